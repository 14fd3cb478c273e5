// fork, vfork, posix_spawn and exit in a program whose threads call the library and trace. With the platform libraries
// as they are built.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldtr.h>
#include <net/if.h>
#include <osutils.h>
#include <pthread.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "exported_calls.h"
#include "test_libtrc.h"
#include "world.h"

using VRAOSUtils::EtcServices;

#ifdef __SANITIZE_THREAD__
#define SKIP_WITH_TSAN()                                                                      \
  GTEST_SKIP() << "TSan knows neither the C library's locks nor the end of other threads in " \
                  "exit()"
#else
#define SKIP_WITH_TSAN() (void)0
#endif

namespace {

// Refers to nothing that exit() destroys.
void callMuch(int seed) {
  char dn[] = "cn = a ; o = x";
  char name[] = "inst1";
  switch (seed % 8) {
    case 0:
      (void)doesFileExist("/nonexistent");
      break;
    case 1:
      free(formatDn(dn));
      break;
    case 2:
      (void)vra_getpwnam_uid("root");
      break;
    case 3:
      free(getCurrentTimeStamp(1));
      break;
    case 4:
      (void)isValidName(name);
      break;
    case 5: {
      EtcServices list;
      (void)list.readEtcServices();
      break;
    }
    case 6:
      // A thread with its first record makes files under the lock of the trace.
      std::thread([] { (void)doesFileExist(nullptr); }).join();
      break;
    default:
      (void)ldtr_init();
  }
}

// Threads that call the library until the end of the scope.
class Callers {
 public:
  Callers() {
    for (int number = 0; number < kThreads; ++number) {
      threads_.emplace_back([this, number] {
        for (int call = number; !stop_; ++call) {
          callMuch(call);
          (void)usleep(100);
        }
      });
    }
  }
  ~Callers() {
    stop_ = true;
    for (std::thread& thread : threads_) thread.join();
  }
  Callers(const Callers&) = delete;
  Callers& operator=(const Callers&) = delete;

 private:
  static constexpr int kThreads = 8;
  std::atomic<bool> stop_ = false;
  std::vector<std::thread> threads_;
};

// What `fork` at the top of osutils.h excludes for the child.
bool isForChildren(const ExportedCall& call) {
  static const std::vector<std::string> kExcluded = {
      "copyFile", "putEnvVar", "getCurrentTimeStamp", "loadSharedLib",
      // both copy the file
      "_ZN10VRAOSUtils11EtcServices13deleteServiceEPKc",
      "_ZN10VRAOSUtils10EtcInittab18deleteInittabEntryEPKc"};
  return call.enters == Enters::kNothing &&
         std::find(kExcluded.begin(), kExcluded.end(), call.symbols.front()) == kExcluded.end();
}

// Returns 0, or 1 + the number of the first call whose result is wrong.
int callInChild(const std::vector<ExportedCall>& calls) {
  for (size_t i = 0; i < calls.size(); ++i) {
    if (isForChildren(calls[i]) && !calls[i].body()) return static_cast<int>(i) + 1;
  }
  int result = 0;
  std::thread([&] { result = doesFileExist("/") ? 0 : 250; }).join();
  return result;
}

void traceAll(const std::string& directory) {
  setenv("TRC_DIR", directory.c_str(), 1);
  setenv("TRC_EVENTS", "all", 1);
  EXPECT_EQ(ldtr_init(), 0);
}

// Messages are printed too, because main() has set PRINT_DEBUG.
void discardStandardError() {
  const int sink = open("/dev/null", O_WRONLY);
  EXPECT_EQ(dup2(sink, STDERR_FILENO), STDERR_FILENO);
  close(sink);
}

// Every process with its number of scopes that were entered and left.
struct Scopes {
  int entered = 0;
  int left = 0;
};

std::map<int, Scopes> scopesIn(const std::string& directory) {
  std::map<int, Scopes> scopes;
  for (const Event& event : readEvents(directory)) {
    Scopes& process = scopes[event.pid];
    process.entered += event.type.starts_with("\"entry\"") ? 1 : 0;
    process.left += event.type.starts_with("\"exit") ? 1 : 0;
  }
  return scopes;
}

TEST(Fork, AChildOfManyThreadsMayCallWhatTheHeaderAllows) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer's own locks stay locked in the child";
#endif
  constexpr int kRounds = 25;
  const TempDir temp;
  const std::string traces = temp.path("traces");
  const std::string directory = temp.dir("calls");
  EXPECT_EQ(inChild([&] {
              discardStandardError();
              traceAll(traces);
              const auto calls = exportedCalls(directory);
              useCalls(directory);  // no thread may use the environment meanwhile
              const Callers callers;
              for (int round = 0; round < kRounds; ++round) {
                fillCalls(directory);
                const pid_t child = fork();
                if (child == 0) {
                  (void)alarm(60);  // in case that a lock is left locked
                  _exit(callInChild(calls));
                }
                int status = -1;
                EXPECT_EQ(waitpid(child, &status, 0), child);
                EXPECT_EQ(status, 0);
                if (WIFEXITED(status) && WEXITSTATUS(status) != 0) {
                  ADD_FAILURE() << calls.at(WEXITSTATUS(status) - 1U).symbols.front();
                }
              }
              return 0;
            }),
            0);
  const auto scopes = scopesIn(traces);
  EXPECT_EQ(scopes.size(), kRounds + 1U);
  for (const auto& [process, count] : scopes) {
    EXPECT_GT(count.entered, 50);
    EXPECT_EQ(count.entered, count.left);
  }
}

TEST(Spawn, AChildThatOnlyExecutesDisturbsNoTrace) {
  SKIP_WITH_TSAN();
  const TempDir temp;
  const std::string traces = temp.path("traces");
  EXPECT_EQ(inChild([&] {
              discardStandardError();
              traceAll(traces);
              const Callers callers;
              char program[] = "/bin/true";
              char* const arguments[] = {program, nullptr};
              for (int round = 0; round < 100; ++round) {
                pid_t child = -1;
                if (round % 2 == 0) {
                  child = vfork();
                  if (child == 0) {
                    (void)execve(program, arguments, environ);
                    _exit(127);
                  }
                } else {
                  EXPECT_EQ(posix_spawn(&child, program, nullptr, nullptr, arguments, environ), 0);
                }
                int status = -1;
                EXPECT_EQ(waitpid(child, &status, 0), child);
                EXPECT_EQ(status, 0);
              }
              return 0;
            }),
            0);
  const auto scopes = scopesIn(traces);
  ASSERT_EQ(scopes.size(), 1U);
  EXPECT_EQ(scopes.begin()->second.entered, scopes.begin()->second.left);
}

class Exit : public testing::TestWithParam<bool> {};

INSTANTIATE_TEST_SUITE_P(Tracing, Exit, testing::Bool(), [](const auto& tested) {
  return std::string(tested.param ? "On" : "Off");
});

// Some threads are in calls that wait.
TEST_P(Exit, OfAnyThreadEndsTheProcessAmidCalls) {
  SKIP_WITH_TSAN();
  constexpr int kRounds = 30;
  const TempDir temp;
  const std::string traces = temp.path("traces");
  const std::string locked = temp.file("locked", "");
  const std::string launcher = temp.file("vrarun", "#!/bin/sh\nexec sleep 5\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0755), 0);
  const int held = open(locked.c_str(), O_RDWR);
  ASSERT_EQ(lockf(held, F_LOCK, 0), 0);
  for (int round = 0; round < kRounds; ++round) {
    fflush(nullptr);
    const pid_t child = fork();
    if (child == 0) {
      (void)alarm(60);
      discardStandardError();
      if (GetParam()) traceAll(traces);
      static pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
      (void)pthread_mutex_lock(&mutex);
      std::thread([&] { (void)clearFile(locked.c_str()); }).detach();
      std::thread([&] { (void)startProcess(temp.path().c_str(), ""); }).detach();
      std::thread([] { const AutoLock lock(&mutex, true); }).detach();
      for (int number = 0; number < 6; ++number) {
        std::thread([number] {
          for (int call = number;; ++call) callMuch(call);
        }).detach();
      }
      (void)usleep(static_cast<useconds_t>(round) * 200);
      if (round % 2 == 0) exit(7);
      std::thread([] { exit(7); }).detach();
      for (;;) pause();
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 7) << status;
  }
  close(held);
  EXPECT_EQ(pathExists(traces), GetParam());
  if (!GetParam()) return;
  int records = 0;
  for (const auto& [process, count] : scopesIn(traces)) records += count.entered;
  EXPECT_GT(records, kRounds);
}

}  // namespace

// The platform reads these switches when it is loaded.
int main(int argc, char** argv) {
  if (getenv("PRINT_DEBUG") == nullptr) {
    setenv("PRINT_DEBUG", "all", 1);
    execv("/proc/self/exe", argv);
  }
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
