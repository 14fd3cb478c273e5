// A thread that is cancelled in the library: the process continues, and the call leaks no more than
// it does without the cancellation.

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldtr.h>
#include <malloc.h>
#include <osutils.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <exception>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "cancelled.h"
#include "exported_calls.h"
#include "faults.h"
#include "records.h"
#include "world.h"

using testing::IsEmpty;

// Defined by the leak sanitizer, when there is one.
extern "C" void __lsan_disable() __attribute__((weak));

namespace {

// When the thread is cancelled. At most one of the two numbers is not 0; they count from 1.
struct Request {
  bool first = false;  // before the call
  int at_call = 0;     // before this call from the library to the C library or the platform
  int at_record = 0;   // in this record or print
};

struct ThreadRun {
  const std::function<bool()>* body;
  Request request;
  bool asked = false;
  bool right = false;
};

thread_local ThreadRun* current = nullptr;
thread_local int records_made = 0;

void ask() {
  current->asked = true;
  (void)pthread_cancel(pthread_self());
}

// Acts as a site's trace library that is a cancellation point.
void traceCancellably() {
  if (current == nullptr) return;
  if (++records_made == current->request.at_record) ask();
  pthread_testcancel();
}

constexpr size_t kStackBytes = size_t{8} * 1024 * 1024;

// Used by one thread at a time.
void* stack() {
  static void* const memory =
      mmap(nullptr, kStackBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  return memory;
}

extern "C" void* runThread(void* argument) {
  const StackOfThread unmarked_at_the_end{stack(), kStackBytes};
  if (__lsan_disable != nullptr) __lsan_disable();  // some calls leak memory deliberately
  ThreadRun& run = *static_cast<ThreadRun*>(argument);
  current = &run;
  {
    std::optional<BeforeCall> at;
    if (run.request.at_call > 0) at.emplace(Call::any, ask, run.request.at_call);
    if (run.request.first) ask();
    run.right = (*run.body)();
  }
  pthread_testcancel();
  return nullptr;
}

// Runs the body in a thread of its own and returns whether the thread was cancelled.
bool runInThread(ThreadRun& run) {
  pthread_attr_t attributes;
  EXPECT_EQ(pthread_attr_init(&attributes), 0);
  EXPECT_EQ(pthread_attr_setstack(&attributes, stack(), kStackBytes), 0);
  pthread_t thread;
  void* result = nullptr;
  EXPECT_EQ(pthread_create(&thread, &attributes, runThread, &run), 0);
  EXPECT_EQ(pthread_join(thread, &result), 0);
  EXPECT_EQ(pthread_attr_destroy(&attributes), 0);
  return result == PTHREAD_CANCELED;
}

constexpr int kRounds = 3;
// Of the C library's allocator. A block may be up to 16 bytes larger than requested, when the rest
// of a free block would be too small for a block of its own.
constexpr long kSmallestBlock = 32;

struct Left {
  long bytes;
  int descriptors;
};

// Returns what the run leaves allocated and open in this process.
Left leftBy(ThreadRun& run) {
  const int descriptors = openDescriptors();
  const auto bytes = static_cast<long>(mallinfo2().uordblks);
  EXPECT_EQ(runInThread(run), run.asked);
  const auto bytes_after = static_cast<long>(mallinfo2().uordblks);
  return {sanitizerOwnsMalloc() ? 0 : bytes_after - bytes, openDescriptors() - descriptors};
}

const char* running = "";
Request requested;

[[noreturn]] void reportEnd() {
  printf("the process ended: %s, asked %s, at call %d, at record %d\n", running,
         requested.first ? "first" : "later", requested.at_call, requested.at_record);
  fflush(stdout);
  _exit(98);
}

class EveryCall : public testing::TestWithParam<size_t> {
 protected:
  // Runs the body in a child process with a directory for the calls.
  void inWorldOfItsOwn(const std::function<void(const ExportedCall&)>& body) {
    const TempDir temp;
    const ExportedCall call = exportedCalls(temp.path())[GetParam()];
    const auto run = [&] {
      (void)alarm(200);  // in case that a lock is left locked
      (void)prctl(PR_SET_CHILD_SUBREAPER, 1);
      (void)mallopt(M_ARENA_MAX, 1);
      running = call.symbols.front().c_str();
      std::set_terminate(reportEnd);
      directory_ = temp.path();
      body(call);
      return 0;
    };
    if (call.enters != Enters::kResolver) {
      EXPECT_EQ(inChild(run), 0);
      return;
    }
    REQUIRE_ROOT("for hosts of its own");
    EXPECT_EQ(withPrivateNetwork([&] {
                writeFile("/etc/hosts", "127.0.0.1 localhost\n");
                return run();
              }),
              0);
  }

  Left leftAfter(const ExportedCall& call, const Request& request, bool& asked) {
    prepareCalls(directory_);
    ThreadRun run{&call.body, request};
    requested = request;
    const Left left = leftBy(run);
    // The children of a killed shell continue and would disturb the next call.
    while (wait(nullptr) != -1) {
    }
    asked = run.asked;
    EXPECT_TRUE(run.right || run.asked);
    return left;
  }

  // Expects that no more is left than usual. Returns false if the request was never made.
  bool leavesNoMore(const ExportedCall& call, const Request& request, const Left& usual) {
    bool asked = false;
    Left left = leftAfter(call, request, asked);
    // Only what is left each time is a leak: the C library allocates and frees memory of its own.
    const long limit = usual.bytes + kSmallestBlock;
    for (int again = 0; again < kRounds && left.bytes >= limit; ++again) {
      left = leftAfter(call, request, asked);
    }
    EXPECT_LT(left.bytes, limit);
    EXPECT_LE(left.descriptors, usual.descriptors);
    return asked;
  }

  Left usuallyLeft(const ExportedCall& call) {
    bool asked = false;
    for (int round = 0; round < kRounds; ++round) (void)leftAfter(call, {}, asked);
    return leftAfter(call, {}, asked);
  }

  // Cancels the thread before the call, and then before each call that the library makes.
  void askEverywhere(const ExportedCall& call) {
    const Left usual = usuallyLeft(call);
    const Request first{.first = true};
    EXPECT_TRUE(leavesNoMore(call, first, usual));
    Request request;
    do {
      ++request.at_call;
      ASSERT_LT(request.at_call, 1000);
    } while (leavesNoMore(call, request, usual) && !HasFailure());
    bool asked = false;
    (void)leftAfter(call, {}, asked);  // succeeds only if no lock is left locked
  }

  std::string directory_;
};

TEST_P(EveryCall, LeavesNothingMoreWhenItsThreadIsCancelled) {
  inWorldOfItsOwn([this](const ExportedCall& call) {
    askEverywhere(call);

    __atomic_store_n(&trcEvents, kAllEvents, __ATOMIC_RELAXED);
    readLdapDebugAnswer = 1;
    atTracing = traceCancellably;
    askEverywhere(call);
    const Left usual = usuallyLeft(call);
    Request request;
    do {
      ++request.at_record;
      ASSERT_LT(request.at_record, 1000);
    } while (leavesNoMore(call, request, usual) && !HasFailure());
  });
}

std::string nameOf(const testing::TestParamInfo<size_t>& info) {
  std::string name = exportedCalls("")[info.param].symbols.front();
  std::erase(name, '*');
  return name;
}

INSTANTIATE_TEST_SUITE_P(Of, EveryCall, testing::Range(size_t{0}, exportedCalls("").size()),
                         nameOf);

// The first call leaves a pipe open and keeps the answer for later calls.
TEST(IsNPTL, LeavesOnePipeThoughItsThreadIsCancelled) {
  EXPECT_EQ(inChild([] {
              const int before = openDescriptors();
              const std::function<bool()> body = [] { return isNPTL(); };
              for (int round = 0; round < 2; ++round) {
                ThreadRun run{&body, {.first = true}};
                EXPECT_TRUE(runInThread(run));
                EXPECT_TRUE(run.right);
                EXPECT_EQ(openDescriptors(), before + 1);
              }
              return 0;
            }),
            0);
}

TEST(System, EndsWhenItsThreadIsCancelled) {
  const TempDir temp;
  const std::string started = temp.path("started");
  const std::string launcher =
      temp.file("vrarun", "#!/bin/sh\n: > " + started + "\nexec sleep 60\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0755), 0);
  EXPECT_EQ(inChild([&] {
              static bool returned = false;
              const auto body = [](void* directory) -> void* {
                (void)startProcess(static_cast<const char*>(directory), "");
                returned = true;
                return nullptr;
              };
              pthread_t thread;
              void* result = nullptr;
              std::string directory = temp.path();
              EXPECT_EQ(pthread_create(&thread, nullptr, body, directory.data()), 0);
              while (!pathExists(started)) (void)usleep(1000);
              EXPECT_EQ(pthread_cancel(thread), 0);
              EXPECT_EQ(pthread_join(thread, &result), 0);
              EXPECT_EQ(result, PTHREAD_CANCELED);
              EXPECT_FALSE(returned);
              return 0;
            }),
            0);
}

TEST(EveryExportedFunction, IsCalledHere) {
  EXPECT_THAT(symbolsWithoutCall(exportedCalls("")), IsEmpty());
}

}  // namespace
