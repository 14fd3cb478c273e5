#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <map>
#include <new>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "world.h"

using testing::ElementsAre;
using testing::SizeIs;

namespace {

std::atomic<int> files_opened;
std::atomic<int> descriptors_in_place_of_a_stream;  // as seen by openat() and write()
std::atomic<int> to_become_standard_output{-1};     // during the next openat()

bool isStandardStreamOpen() {
  for (int stream = 0; stream <= STDERR_FILENO; ++stream) {
    if (fcntl(stream, F_GETFD) != -1) return true;
  }
  return false;
}

TEST(TrcProgram, KeepsItsErrnoItsDescriptorsAndItsSignalMask) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    const int descriptors = openDescriptors();
    errno = 77;
    traceMuch(1);
    EXPECT_EQ(errno, 77);
    EXPECT_EQ(openDescriptors(), descriptors);
    sigset_t mask;
    pthread_sigmask(SIG_BLOCK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGTERM), 0);
    fs::remove_all(temp.path("t"));
    errno = 77;
    traceMuch(1);  // no further file can be created
    EXPECT_EQ(errno, 77);
    EXPECT_EQ(openDescriptors(), descriptors);
  });
  EXPECT_FALSE(pathExists(temp.path("t")));
}

// Text that other threads print to a closed standard stream must not get into a trace file.
TEST(TrcProgram, WithoutStandardStreamsNeverHasAFileInTheirPlace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              const int kept[] = {dup(0), dup(1), dup(2)};
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) close(stream);
              instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
                const int descriptor = real::openat(directory, path, flags, mode);
                ++files_opened;
                if (descriptor >= 0 && descriptor <= STDERR_FILENO)
                  ++descriptors_in_place_of_a_stream;
                return descriptor;
              };
              instead::write = [](int descriptor, const void* data, size_t bytes) {
                if (isStandardStreamOpen()) ++descriptors_in_place_of_a_stream;
                return real::write(descriptor, data, bytes);
              };
              const int rc = traceInto(temp.path("t"));
              traceMuch(1);
              std::thread([] { message("other"); }).join();
              const int opened = files_opened;
              const int in_place = descriptors_in_place_of_a_stream;
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) dup2(kept[stream], stream);
              EXPECT_EQ(rc, 0);
              EXPECT_GT(opened, 10);
              EXPECT_EQ(in_place, 0);
              return 0;
            }),
            0);
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1001));
}

TEST(TrcProgram, MayOpenAStandardStreamAgainWhileAFileIsMade) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              const int kept = dup(STDOUT_FILENO);
              close(STDOUT_FILENO);
              to_become_standard_output = kept;
              instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
                const int output = to_become_standard_output.exchange(-1);
                if (output >= 0) (void)dup2(output, STDOUT_FILENO);
                return real::openat(directory, path, flags, mode);
              };
              const int rc = traceInto(temp.path("t"));
              const bool is_open = fcntl(STDOUT_FILENO, F_GETFD) != -1;
              dup2(kept, STDOUT_FILENO);
              EXPECT_EQ(rc, 0);
              EXPECT_EQ(to_become_standard_output, -1);
              EXPECT_TRUE(is_open);
              return 0;
            }),
            0);
}

// A record that is written inside trcInit() must not wait for the end of trcInit().
TEST(TrcProgram, MayTraceItsOwnSystemCalls) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    std::atomic<bool> is_done{false};
    const auto tracing_openat = [](int directory, const char* path, int flags, mode_t mode) {
      trcWriteRec(kDebug, kDoesFileExist, nullptr, 6, "openat", 0, 0, 0, 0);
      return real::openat(directory, path, flags, mode);
    };
    std::thread tracing([&] {  // which has no file yet
      instead::openat = tracing_openat;
      EXPECT_EQ(trcInit(), 0);
      instead::openat = nullptr;
      message("recorded");
      instead::openat = tracing_openat;
      EXPECT_EQ(trcInit(), 0);
      instead::openat = nullptr;
      is_done = true;
    });
    for (int waited = 0; !is_done && waited < 60'000; ++waited) usleep(1000);
    if (!is_done) _exit(2);
    tracing.join();
  });
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_THAT(texts(reading.events), ElementsAre("recorded"));
  EXPECT_GT(discarded(reading), 0U) << reading.errors;
}

// A separate function that returns: the address sanitizer would treat the variables of a function
// that a cancelled thread leaves as live.
__attribute__((noinline)) void traceFromFirstToLast() {
  message("first");  // creates the trace and the thread's file
  traceMuch(1);
  message("last");
}

void* cancelledWhileItTraces(void*) {
  pthread_cancel(pthread_self());
  traceFromFirstToLast();
  pthread_testcancel();
  return nullptr;
}

TEST(TrcProgram, ACancelledThreadFinishesItsRecords) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              const int descriptors = openDescriptors();
              pthread_t thread;
              if (pthread_create(&thread, nullptr, cancelledWhileItTraces, nullptr) != 0) return 2;
              void* result = nullptr;
              pthread_join(thread, &result);
              EXPECT_EQ(result, PTHREAD_CANCELED);
              EXPECT_EQ(openDescriptors(), descriptors);
              message("main");  // nothing is left locked
              return 0;
            }),
            0);
  const std::vector<std::string> found = texts(readEvents(temp.path("t")));
  ASSERT_THAT(found, SizeIs(1003));
  EXPECT_EQ(found[1001], "last");
  EXPECT_EQ(found[1002], "main");
}

TEST(TrcProgram, AThreadOfTheSmallestStackCanTrace) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "instrumented frames are larger";
#endif
  const TempDir temp;
  ASSERT_EQ(
      inChild([&] {
        setenv("TRC_DIR", temp.path("t").c_str(), 1);
        pthread_attr_t attributes;
        pthread_attr_init(&attributes);
        if (pthread_attr_setstacksize(&attributes, static_cast<size_t>(PTHREAD_STACK_MIN)) != 0)
          return 1;
        pthread_t thread;
        if (pthread_create(
                &thread, &attributes,
                [](void*) -> void* {
                  volatile char used_by_callers[6 << 10];
                  used_by_callers[0] = 'i';
                  if (trcInit() == 0 && used_by_callers[0] == 'i') message("in a small place");
                  return nullptr;
                },
                nullptr) != 0) {
          return 2;
        }
        pthread_join(thread, nullptr);
        return 0;
      }),
      0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("in a small place"));
}

// ---- Termination by SIGKILL ----

constexpr int kKilledThreads = 4;
struct Noted {
  std::atomic<uint64_t> last[kKilledThreads];
};

TEST(TrcKilled, EveryTraceIsReadableUpToItsLastRecord) {
  constexpr int kProcesses = 200;
  const TempDir temp;
  void* const memory =
      mmap(nullptr, sizeof(Noted), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(memory, MAP_FAILED);
  std::minstd_rand random(20);
  int traced = 0;
  int changed_files = 0;

  for (int process = 0; process < kProcesses; ++process) {
    SCOPED_TRACE(process);
    auto* const noted = new (memory) Noted{};
    const std::string root = temp.path("t");
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      if (traceInto(root) != 0) _exit(1);
      std::vector<std::thread> threads;
      for (int t = 0; t < kKilledThreads; ++t) {
        threads.emplace_back([t, noted] {
          const std::string filler(150, '.');
          for (uint64_t number = 1;; ++number) {
            message(std::to_string(t) + " " + std::to_string(number) + filler);
            noted->last[t].store(number, std::memory_order_relaxed);
          }
        });
      }
      for (std::thread& thread : threads) thread.join();
    }
    // Most are killed while they trace, some while they start. The number of records is limited
    // and not the time, because reading records takes much longer than writing them.
    if (process % 8 == 0) {
      usleep(static_cast<useconds_t>(random() % 2000));
    } else {
      const uint64_t enough = random() % 800;
      while (noted->last[0].load(std::memory_order_relaxed) <= enough) usleep(10);
    }
    ASSERT_EQ(kill(pid, SIGKILL), 0);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFSIGNALED(status)) << "it ended by itself: " << status;

    std::map<std::string, uint64_t> last;
    std::vector<fs::path> traces;
    if (fs::exists(root)) traces = entries(root);
    ASSERT_LE(traces.size(), 1U);
    for (const fs::path& trace : traces) {
      if (isHidden(trace)) continue;
      const Reading reading = read(trace);
      ASSERT_EQ(reading.exit_status, 0) << reading.errors;
      ASSERT_EQ(reading.errors, "");
      for (const Event& event : reading.events) {
        const std::string thread = event.text.substr(0, 1);
        ASSERT_EQ(event.text.substr(0, event.text.find('.')),
                  thread + " " + std::to_string(++last[thread]));
      }
      traced += last.empty() ? 0 : 1;
      changed_files += entries(trace).size() > kKilledThreads + 1 ? 1 : 0;
    }
    for (int t = 0; t < kKilledThreads; ++t) {
      EXPECT_GE(last[std::to_string(t)], noted->last[t].load()) << "thread " << t;
    }
    fs::remove_all(root);
  }
  EXPECT_GE(traced, kProcesses / 2);
  EXPECT_GE(changed_files, kProcesses / 4);
  munmap(memory, sizeof(Noted));
}

}  // namespace
