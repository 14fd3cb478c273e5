#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <link.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <atomic>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "platform.h"
#include "records.h"
#include "test_ldtr.h"

using testing::IsEmpty;

namespace {

// ---- AutoLock ----

constexpr char kMoreSeconds[] =
    "Couldn't get access to mutex controlled resource (still busy). Will wait for 30 more seconds.";
constexpr char kExpired[] =
    "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)";

class Lock : public testing::Test {
 protected:
  Lock() {
    unsetenv("AUTOLOCKTYPE");
    default_autolock = 0;
    configfile_read = 1;
    al_configfile_counter = 0;
  }
  ~Lock() override { unsetenv("AUTOLOCKTYPE"); }

  // Tried in another thread: the owner of a recursive mutex can lock it again.
  bool isHeld() {
    int rc = 0;
    std::thread([&] {
      rc = pthread_mutex_trylock(&mutex_);
      if (rc == 0) pthread_mutex_unlock(&mutex_);
    }).join();
    return rc == EBUSY;
  }

  std::string failedTry(int phase, const char* delay) {
    char text[200];
    snprintf(text, sizeof text, "D %d failed to trylock%d %p, waiting %s\n",
             static_cast<int>(pthread_self()), phase, static_cast<void*>(&mutex_), delay);
    return text;
  }

  std::vector<std::string> waiting(int first, bool first_over, int second) {
    std::vector<std::string> lines(static_cast<size_t>(first), failedTry(1, "0.1s"));
    if (first_over) lines.push_back(std::string("D ") + kMoreSeconds + "\n");
    lines.insert(lines.end(), static_cast<size_t>(second), failedTry(2, "1s"));
    return lines;
  }

  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
};

using AutoLockTest = Lock;
using LockType = Lock;

TEST_F(AutoLockTest, OfANullMutexDoesNothing) {
  const Records records;
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
  const FailingCall trylock(Call::pthread_mutex_trylock, EINVAL);
  const FailingCall unlock(Call::pthread_mutex_unlock, EINVAL);
  const FailingCall setting(Call::ldap_getenv, EINVAL);
  { const AutoLock timed(nullptr, true); }
  { const AutoLock untimed(nullptr, false); }
  EXPECT_EQ(lock.calls(), 0);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(unlock.calls(), 0);
  EXPECT_EQ(setting.calls(), 0);
  EXPECT_EQ(al_configfile_counter, 0);
  EXPECT_EQ(default_autolock, 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, UntimedHoldsTheMutexForItsScope) {
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall setting(Call::ldap_getenv, EINVAL);
  {
    const AutoLock lock(&mutex_, false);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_FALSE(isHeld());
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(setting.calls(), 0);
  EXPECT_EQ(al_configfile_counter, 0);
}

TEST_F(AutoLockTest, ReleasesWhenAnExceptionLeavesTheScope) {
  EXPECT_THROW(
      {
        const AutoLock lock(&mutex_, false);
        throw std::runtime_error("leaving");
      },
      std::runtime_error);
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoLockTest, TimedTakesAFreeMutexAtOnce) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall lock_calls(Call::pthread_mutex_lock, EINVAL);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
    EXPECT_EQ(default_autolock, 1);
    EXPECT_EQ(al_configfile_counter, 1);
  }
  EXPECT_FALSE(isHeld());
  EXPECT_EQ(lock_calls.calls(), 0);
  EXPECT_EQ(sleep.calls(), 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, TimedWithRegularLockBlocksWithoutMessages) {
  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  const Records records;
  const FakeSleep sleep;
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  std::atomic<int> step = 0;
  std::thread holder([&] {
    pthread_mutex_lock(&mutex_);
    step = 1;
    step.notify_all();
    step.wait(1);
    pthread_mutex_unlock(&mutex_);
  });
  step.wait(0);
  const BeforeCall release(Call::pthread_mutex_lock, [&] {
    step = 2;
    step.notify_all();
  });
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  holder.join();
  EXPECT_TRUE(release.fired());
  EXPECT_EQ(default_autolock, 0);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(sleep.calls(), 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, TimedWithALockTypeOtherThanOneBlocks) {
  default_autolock = 2;
  al_configfile_counter = 1;
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall lock_calls(Call::pthread_mutex_lock, EINVAL, 1000);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(default_autolock, 2);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(lock_calls.calls(), 1);
}

TEST_F(AutoLockTest, TimedReadsTheSettingOncePerConfiguration) {
  const FailingCall setting(Call::ldap_getenv, EINVAL, 1000);
  { const AutoLock lock(&mutex_, true); }
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(setting.calls(), 1);
  EXPECT_EQ(default_autolock, 1);

  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  configfile_read = 2;
  { const AutoLock lock(&mutex_, true); }
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(setting.calls(), 2);
  EXPECT_EQ(default_autolock, 0);
}

TEST_F(AutoLockTest, TimedWritesAMessageForEachFailedTry) {
  const Records records;
  const FakeSleep sleep;
  FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 50);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(busy.calls(), 51);
  EXPECT_EQ(sleep.calls(), 50);
  EXPECT_EQ(sleep.microseconds(), 50 * 100'000LL);
  EXPECT_EQ(records.trail(), waiting(50, false, 0));
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoLockTest, TimedAcquiresAMutexThatAnotherThreadHeldForAWhile) {
  const Records records;
  const FakeSleep sleep;
  std::atomic<int> step = 0;
  std::thread holder([&] {
    pthread_mutex_lock(&mutex_);
    step = 1;
    step.notify_all();
    step.wait(1);
    pthread_mutex_unlock(&mutex_);
    step = 3;
    step.notify_all();
  });
  step.wait(0);
  // The other thread unlocks right before the library's 21st try.
  const BeforeCall release(
      Call::pthread_mutex_trylock,
      [&] {
        step = 2;
        step.notify_all();
        step.wait(2);
      },
      21);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  holder.join();
  EXPECT_TRUE(release.fired());
  EXPECT_EQ(records.trail(), waiting(20, false, 0));
  EXPECT_EQ(sleep.calls(), 20);
}

TEST_F(AutoLockTest, TimedMayStillAcquireInTheLastTryOfTheFirstPhase) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 299);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(records.trail(), waiting(299, false, 0));
  EXPECT_EQ(sleep.calls(), 299);
}

TEST_F(AutoLockTest, TimedSleepsOnAfterASignal) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall interrupted(Call::nanosleep, EINTR, 1, 3);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(interrupted.calls(), 4);
  EXPECT_EQ(sleep.calls(), 1);
  EXPECT_EQ(records.trail(), waiting(1, false, 0));
}

TEST_F(AutoLockTest, TimedSaysWhenTheSecondPhaseBegins) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 300);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 0));
  EXPECT_EQ(sleep.microseconds(), 300 * 100'000LL);
}

TEST_F(AutoLockTest, TimedMayStillAcquireInTheVeryLastTry) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 869);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 569));
  EXPECT_EQ(sleep.calls(), 869);
  EXPECT_FALSE(isHeld());
}

// Returns what the constructor threw, or null.
const char* thrownBy(pthread_mutex_t* mutex) {
  try {
    const AutoLock lock(mutex, true);
  } catch (const char* text) {
    return text;
  }
  return nullptr;
}

TEST_F(AutoLockTest, TimedThrowsAfter870Tries) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 10'000);

  EXPECT_STREQ(thrownBy(&mutex_), kExpired);

  EXPECT_EQ(busy.calls(), 300 + 570);
  EXPECT_EQ(sleep.calls(), 300 + 570);
  EXPECT_EQ(sleep.microseconds(), 300 * 100'000LL + 570 * 1'000'000LL);
  std::vector<std::string> expected = waiting(300, true, 570);
  expected.push_back(std::string("D ") + kExpired + "\n");
  EXPECT_EQ(records.trail(), expected);
}

TEST_F(AutoLockTest, TimedThrowsWithoutMessagesWhileDebugIsOffAndUnlocksNothing) {
  const Records records(kAllEvents & ~kDebug);
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 10'000);
  const FailingCall unlock(Call::pthread_mutex_unlock, EPERM, 1, 10'000);

  EXPECT_STREQ(thrownBy(&mutex_), kExpired);

  EXPECT_EQ(busy.calls(), 870);
  EXPECT_EQ(sleep.calls(), 870);
  EXPECT_EQ(unlock.calls(), 0);
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST_F(AutoLockTest, TimedTakesAnyOtherErrorForSuccess) {
  for (const int error : {EINVAL, EAGAIN, EPERM, EDEADLK}) {
    SCOPED_TRACE(error);
    const Records records;
    const FakeSleep sleep;
    const FailingCall invalid(Call::pthread_mutex_trylock, error);
    // The destructor unlocks a mutex that is not locked, so pthread_mutex_unlock() is made to fail.
    const FailingCall unlock(Call::pthread_mutex_unlock, EPERM);
    {
      const AutoLock lock(&mutex_, true);
      EXPECT_FALSE(isHeld());
      EXPECT_EQ(unlock.calls(), 0);
    }
    EXPECT_EQ(invalid.calls(), 1);
    EXPECT_EQ(unlock.calls(), 1);
    EXPECT_EQ(sleep.calls(), 0);
    EXPECT_THAT(records.trail(), IsEmpty());
  }
}

TEST_F(AutoLockTest, TimedTakesAnErrorAfterFailedTriesForSuccessToo) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 310);
  const FailingCall invalid(Call::pthread_mutex_trylock, EINVAL, 311);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_FALSE(isHeld());
    // So that the destructor unlocks a locked mutex.
    pthread_mutex_lock(&mutex_);
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 10));
}

TEST_F(LockType, StaysWhileTheConfigurationIsTheSame) {
  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  const FailingCall setting(Call::ldap_getenv, EINVAL, 1000);
  configfile_read = 5;
  for (const int counter : {5, 6, 1000}) {
    al_configfile_counter = counter;
    EXPECT_EQ(AutoLock::ReadAndSetLockType(7), 7);
    EXPECT_EQ(al_configfile_counter, counter);
  }
  EXPECT_EQ(setting.calls(), 0);
}

TEST_F(LockType, FollowsTheSettingAfterAReading) {
  const std::pair<const char*, int> cases[] = {
      {nullptr, 1},       {"REGULARLOCK", 0},  {"", 1},
      {"regularlock", 1}, {"REGULARLOCK ", 1}, {" REGULARLOCK", 1},
      {"REGULARLOC", 1},  {"REGULARLOCK2", 1}, {"TIMEDLOCK", 1},
  };
  for (const auto& [value, type] : cases) {
    SCOPED_TRACE(value == nullptr ? "unset" : value);
    for (const int counter : {4, 0, -3}) {
      if (value == nullptr) {
        unsetenv("AUTOLOCKTYPE");
      } else {
        setenv("AUTOLOCKTYPE", value, 1);
      }
      configfile_read = 5;
      al_configfile_counter = counter;
      EXPECT_EQ(AutoLock::ReadAndSetLockType(7), type);
      EXPECT_EQ(al_configfile_counter, 5);
      EXPECT_EQ(AutoLock::ReadAndSetLockType(7), 7);
    }
  }
  EXPECT_EQ(default_autolock, 0);  // the constructor stores the setting
}

TEST_F(LockType, LeavesTheCopyOfTheSettingAllocated) {
  REQUIRE_OWN_MALLOC();
  for (const char* const value : {"REGULARLOCK", "anything"}) {
    setenv("AUTOLOCKTYPE", value, 1);
    al_configfile_counter = 0;
    const LiveAllocations live;
    AutoLock::ReadAndSetLockType(1);
    EXPECT_EQ(live.blocks(), 1) << value;
  }
  unsetenv("AUTOLOCKTYPE");
  al_configfile_counter = 0;
  const LiveAllocations live;
  AutoLock::ReadAndSetLockType(1);
  EXPECT_EQ(live.blocks(), 0);
}

// ---- AutoFree ----

int released_count = 0;
void* released_last = nullptr;
void countRelease(void* memory) {
  ++released_count;
  released_last = memory;
}

class Buffer : public testing::Test {
 protected:
  Buffer() {
    released_count = 0;
    released_last = nullptr;
  }

  char buffer_[4] = "abc";
};

using AutoFreeTest = Buffer;

TEST_F(AutoFreeTest, ReleasesItsPointerOnceAtItsEnd) {
  {
    const AutoFree<char> owner(buffer_, countRelease);
    EXPECT_EQ(owner.get(), buffer_);
    EXPECT_EQ(owner.get(), buffer_);
    EXPECT_EQ(released_count, 0);
  }
  EXPECT_EQ(released_count, 1);
  EXPECT_EQ(released_last, buffer_);
}

TEST_F(AutoFreeTest, OfANullPointerReleasesNothing) {
  { EXPECT_EQ(AutoFree<char>(nullptr, countRelease).get(), nullptr); }
  EXPECT_EQ(released_count, 0);
  { EXPECT_EQ(AutoFree<char>(nullptr, nullptr).get(), nullptr); }
}

TEST_F(AutoFreeTest, ReadsItsPointerUnderAMutexOfItsOwn) {
  const AutoFree<char> owner(buffer_, countRelease);
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL, 1000);
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY, 1000);
  const FailingCall unlock(Call::pthread_mutex_unlock, EPERM, 1000);
  owner.get();
  EXPECT_EQ(lock.calls(), 1);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(unlock.calls(), 1);
}

TEST_F(AutoFreeTest, TakesNoLockAtItsEnd) {
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL, 1000);
  { const AutoFree<char> owner(buffer_, countRelease); }
  EXPECT_EQ(lock.calls(), 0);
  EXPECT_EQ(released_count, 1);
}

// ---- Binary interface ----

using Destructor = void (*)(void*);

// Returns the entries of the object's vtable. Fails unless there are exactly two.
const Destructor* slotsOf(const void* object, const char* table_name) {
  const Destructor* slots = nullptr;
  memcpy(&slots, object, sizeof slots);
  Dl_info info = {};
  void* found = nullptr;
  EXPECT_NE(dladdr1(static_cast<const void*>(slots), &info, &found, RTLD_DL_SYMENT), 0);
  EXPECT_STREQ(info.dli_sname, table_name);
  const auto* const symbol = static_cast<const ElfW(Sym)*>(found);
  EXPECT_EQ(symbol == nullptr ? 0 : symbol->st_size, 4 * sizeof(void*));  // two words, two slots
  return slots;
}

TEST_F(AutoLockTest, IsATableOfTwoDestructorsAndTheMutex) {
  static_assert(sizeof(AutoLock) == 2 * sizeof(void*));
  void* const place = ::operator new(sizeof(AutoLock));
  auto* const lock = new (place) AutoLock(&mutex_, false);
  EXPECT_EQ(words<2>(*lock)[1], word(&mutex_));
  const Destructor* const slots = slotsOf(lock, "_ZTV8AutoLock");

  slots[0](lock);  // destroys only
  EXPECT_FALSE(isHeld());
  new (place) AutoLock(&mutex_, false);
  slots[1](place);  // also frees the memory; otherwise the leak sanitizer reports it
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoFreeTest, IsATableOfTwoDestructorsThePointerTheReleaseAndTheMutex) {
  constexpr size_t kWords = 3 + sizeof(pthread_mutex_t) / sizeof(void*);
  void* const place = ::operator new(sizeof(AutoFree<char>));
  auto* const owner = new (place) AutoFree<char>(buffer_, countRelease);
  const auto fields = words<kWords>(*owner);
  EXPECT_EQ(fields[1], word(buffer_));
  EXPECT_EQ(fields[2], reinterpret_cast<uintptr_t>(&countRelease));
  const pthread_mutex_t fresh = PTHREAD_MUTEX_INITIALIZER;
  const char* const mutex = static_cast<char*>(place) + 3 * sizeof(void*);
  EXPECT_EQ(memcmp(mutex, &fresh, sizeof fresh), 0);
  const Destructor* const slots = slotsOf(owner, "_ZTV8AutoFreeIcE");

  slots[0](owner);
  EXPECT_EQ(released_count, 1);
  EXPECT_NE(memcmp(mutex, &fresh, sizeof fresh), 0);  // glibc marks a destroyed mutex
  new (place) AutoFree<char>(buffer_, countRelease);
  slots[1](place);
  EXPECT_EQ(released_count, 2);
}

TEST_F(AutoLockTest, IsDestroyedThroughItsBase) {
  struct Derived : AutoLock {
    Derived(pthread_mutex_t* mutex, bool* gone) : AutoLock(mutex, false), gone_(gone) {}
    ~Derived() override { *gone_ = true; }
    bool* gone_;
  };
  bool gone = false;
  AutoLock* const base = new Derived(&mutex_, &gone);
  EXPECT_TRUE(isHeld());
  delete base;
  EXPECT_TRUE(gone);
  EXPECT_FALSE(isHeld());
}

// ---- Threads ----

TEST_F(AutoLockTest, ExcludesOtherThreads) {
  int counter = 0;
  onAllThreads([&](int) {
    for (int turn = 0; turn < 500; ++turn) {
      const AutoLock lock(&mutex_, false);
      ++counter;
    }
  });
  EXPECT_EQ(counter, kThreads * 500);
}

TEST_F(AutoLockTest, TimedOnesDecideTheLockTypeTogether) {
  onAllThreads([](int thread) {
    pthread_mutex_t own = PTHREAD_MUTEX_INITIALIZER;
    for (int turn = 0; turn < 200; ++turn) {
      if (thread == 0) __atomic_add_fetch(&configfile_read, 1, __ATOMIC_RELAXED);
      const AutoLock lock(&own, true);
    }
  });
  EXPECT_EQ(default_autolock, 1);
}

}  // namespace
