// A thread is cancelled at each system call that a function makes, one after the other, inside the C library too: every
// cancellation point of the function and of the platform libraries is among them. The parent process stops the thread
// with ptrace() before each system call and lets another thread cancel it there.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldtr.h>
#include <malloc.h>
#include <osutils.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "exported_calls.h"
#include "platform.h"
#include "trace_numbers.h"
#include "world.h"

namespace {

// System calls that do not exist, before and after the call.
constexpr long kBegin = 100'001;
constexpr long kEnd = 100'002;
constexpr int kRounds = 3;
constexpr long kSmallestBlock = 32;  // of the C library's allocator
constexpr int kNever = 0;
constexpr const char kMeasure[] = "ThreeSystemCalls";  // of this test's own

struct Outcome {
  bool returned;
  bool right;
  bool kept_state;  // of cancellation and signals, after it has returned
  bool ended;       // by the cancellation
  long bytes;
  int descriptors;
};

struct PointCall {
  ExportedCall call;
  bool has_file = true;  // the thread has traced before
  std::function<void()> prepare = [] {};
};

// ---- In the process with the thread ----

struct Thread {
  const PointCall* point;
  int ready;
  int go;
  Outcome outcome;
};

bool hasUsualState(const sigset_t& usual) {
  sigset_t signals = {};
  (void)pthread_sigmask(SIG_SETMASK, nullptr, &signals);
  int state = -1;
  int type = -1;
  (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &state);
  (void)pthread_setcanceltype(PTHREAD_CANCEL_DEFERRED, &type);
  const bool is_usual = state == PTHREAD_CANCEL_ENABLE && type == PTHREAD_CANCEL_DEFERRED &&
                        memcmp(&signals, &usual, sizeof signals) == 0;
  (void)pthread_setcancelstate(state, nullptr);
  return is_usual;
}

extern "C" void* runThread(void* argument) {
  Thread& thread = *static_cast<Thread*>(argument);
  if (thread.point->has_file) (void)doesFileExist(nullptr);
  const auto id = static_cast<pid_t>(syscall(SYS_gettid));
  char token = 0;
  if (write(thread.ready, &id, sizeof id) != sizeof id || read(thread.go, &token, 1) != 1) {
    return nullptr;
  }
  sigset_t signals = {};
  (void)pthread_sigmask(SIG_SETMASK, nullptr, &signals);
  (void)syscall(kBegin);
  thread.outcome.right = thread.point->call.body();
  (void)syscall(kEnd);
  thread.outcome.returned = true;
  thread.outcome.kept_state = hasUsualState(signals);
  pthread_testcancel();
  return nullptr;
}

// Runs the thread once for each 'r' that arrives: cancels it at 'c', joins it at 'j'.
void serve(const PointCall& point, const std::string& directory, int commands, int answers,
           int go) {
  constexpr size_t kStackBytes = size_t{1024} * 1024;
  void* const stack =
      mmap(nullptr, kStackBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  pthread_attr_t attributes;
  (void)pthread_attr_init(&attributes);
  (void)pthread_attr_setstack(&attributes, stack, kStackBytes);
  Thread thread{&point, answers, go, {}};
  pthread_t id{};
  // The first cancellation loads a library: it would wait for a thread that is stopped in the loader.
  const auto wait_for_end = [](void*) -> void* {
    for (;;) pause();
  };
  if (pthread_create(&id, nullptr, wait_for_end, nullptr) != 0 || pthread_cancel(id) != 0 ||
      pthread_join(id, nullptr) != 0) {
    _exit(1);
  }
  int descriptors = 0;
  long bytes = 0;
  for (char command; read(commands, &command, 1) == 1;) {
    if (command == 'r') {
      fillCalls(directory);
      point.prepare();
      thread.outcome = {};
      descriptors = openDescriptors();
      bytes = static_cast<long>(mallinfo2().uordblks);
      if (pthread_create(&id, &attributes, runThread, &thread) != 0) _exit(1);
    } else if (command == 'c') {
      if (pthread_cancel(id) != 0 || write(answers, &command, 1) != 1) _exit(1);
    } else {
      void* result = nullptr;
      (void)pthread_join(id, &result);
      Outcome& outcome = thread.outcome;
      outcome.ended = result == PTHREAD_CANCELED;
      outcome.bytes = static_cast<long>(mallinfo2().uordblks) - bytes;
      outcome.descriptors = openDescriptors() - descriptors;
      // The children of a killed shell continue and would disturb the next call.
      while (wait(nullptr) != -1) {
      }
      if (write(answers, &outcome, sizeof outcome) != sizeof outcome) _exit(1);
    }
  }
}

// ---- In the parent ----

bool mayTraceChildren() {
  const pid_t child = fork();
  if (child == 0) {
    for (;;) pause();
  }
  const bool may = ptrace(PTRACE_SEIZE, child, nullptr, nullptr) == 0;
  (void)kill(child, SIGKILL);
  (void)waitpid(child, nullptr, 0);
  return may;
}

class Points : public testing::TestWithParam<size_t> {
 protected:
  ~Points() override {
    for (const int end : {commands_, answers_, go_}) {
      if (end != -1) close(end);
    }
    if (process_ <= 0) return;
    (void)kill(process_, SIGKILL);
    (void)waitpid(process_, nullptr, 0);
  }

  void start(const PointCall& point, const std::string& directory) {
    int commands[2];
    int answers[2];
    int go[2];
    ASSERT_EQ(pipe2(commands, O_CLOEXEC), 0);
    ASSERT_EQ(pipe2(answers, O_CLOEXEC), 0);
    ASSERT_EQ(pipe2(go, O_CLOEXEC), 0);
    process_ = fork();
    if (process_ == 0) {
      (void)alarm(300);
      (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
      (void)prctl(PR_SET_CHILD_SUBREAPER, 1);
      (void)mallopt(M_ARENA_MAX, 1);
      const int sink = open("/dev/null", O_WRONLY | O_CLOEXEC);
      (void)dup2(sink, STDERR_FILENO);
      for (const int end : {commands[1], answers[0], go[1]}) close(end);
      useCalls(directory);
      if (ldtr_init() != 0) _exit(1);
      serve(point, directory, commands[0], answers[1], go[0]);
      _exit(0);
    }
    for (const int end : {commands[0], answers[1], go[0]}) close(end);
    commands_ = commands[1];
    answers_ = answers[0];
    go_ = go[1];
  }

  bool send(int pipe, char command) const { return ::write(pipe, &command, 1) == 1; }
  template <typename Answer>
  bool receive(Answer& answer) const {
    return ::read(answers_, &answer, sizeof answer) == static_cast<ssize_t>(sizeof answer);
  }

  // Runs the call and cancels its thread at the nth system call. Returns false if it makes fewer.
  bool run(int nth, Outcome& outcome) {
    bool asked = false;
    pid_t thread = -1;
    if (!send(commands_, 'r') || !receive(thread)) {
      ADD_FAILURE() << "the process has ended";
      return false;
    }
    if (ptrace(PTRACE_SEIZE, thread, nullptr, PTRACE_O_TRACESYSGOOD) != 0 ||
        ptrace(PTRACE_INTERRUPT, thread, nullptr, nullptr) != 0) {
      ADD_FAILURE() << "ptrace: " << strerror(errno);
      return false;
    }
    bool is_inside = false;
    int calls = 0;
    bool has_gone = false;
    for (int status; waitpid(thread, &status, __WALL) == thread && WIFSTOPPED(status);) {
      int signal = WSTOPSIG(status);
      if (signal == (SIGTRAP | 0x80)) {
        signal = 0;
        __ptrace_syscall_info info = {};
        (void)ptrace(static_cast<__ptrace_request>(PTRACE_GET_SYSCALL_INFO), thread, sizeof info,
                     &info);
        if (info.op == PTRACE_SYSCALL_INFO_ENTRY) {
          const auto number = static_cast<long>(info.entry.nr);
          if (number == kEnd) is_inside = false;
          if (is_inside && ++calls == nth) {
            char done = 0;
            asked = send(commands_, 'c') && receive(done);
          }
          if (number == kBegin) is_inside = true;
        }
      } else if (status >> 16 != 0) {
        signal = 0;
      }
      (void)ptrace(PTRACE_SYSCALL, thread, nullptr, signal);
      if (!has_gone) has_gone = send(go_, 'g');
    }
    if (!send(commands_, 'j') || !receive(outcome)) ADD_FAILURE() << "the process has ended";
    return asked;
  }

  // Cancels the thread at each system call.
  int cancelEverywhere(const PointCall& point) {
    Outcome usual = {};
    for (int round = 0; round < kRounds; ++round) (void)run(kNever, usual);
    EXPECT_TRUE(usual.right && usual.kept_state && !usual.ended);
    // clearFile and the functions that run a shell, except isNPTL, may end at once.
    const std::string& name = point.call.symbols.front();
    const bool may_end =
        (point.call.enters == Enters::kShell && name != "_Z6isNPTLv") || name == "clearFile";

    int nth = 1;
    for (bool asked = true; asked && !HasFailure(); ++nth) {
      SCOPED_TRACE("at system call " + std::to_string(nth));
      Outcome outcome = {};
      asked = run(nth, outcome);
      // Only what is left each time is a leak: the C library allocates and frees memory of its own.
      for (int again = 0; again < kRounds && outcome.bytes >= usual.bytes + kSmallestBlock;
           ++again) {
        (void)run(nth, outcome);
      }
      EXPECT_LT(outcome.bytes, usual.bytes + kSmallestBlock);
      EXPECT_LE(outcome.descriptors, usual.descriptors);
      EXPECT_EQ(outcome.ended, asked);
      EXPECT_TRUE(outcome.returned || may_end);
      if (outcome.returned) {
        EXPECT_TRUE(outcome.kept_state);
        EXPECT_TRUE(outcome.right || may_end);
      }
    }
    Outcome last = {};
    (void)run(kNever, last);
    EXPECT_TRUE(last.right);  // no lock is left locked
    return nth - 2;
  }

 private:
  pid_t process_ = -1;
  int commands_ = -1;
  int answers_ = -1;
  int go_ = -1;
};

std::vector<PointCall> pointCalls(const std::string& directory, const std::string& traces) {
  std::vector<PointCall> points;
  for (ExportedCall& call : exportedCalls(directory)) points.push_back({std::move(call)});
  const auto add = [&](const char* name, std::function<bool()> body) -> PointCall& {
    points.push_back({{{name}, Enters::kNothing, std::move(body)}});
    return points.back();
  };
  add("FirstRecordOfAThread", [] { return !doesFileExist(nullptr); }).has_file = false;
  PointCall& begin =
      add("FirstRecordOfATrace", [] { return ldtr_init() == 0 && doesFileExist("/"); });
  begin.has_file = false;
  begin.prepare = [traces] {
    static int number = 0;
    (void)setenv("TRC_DIR", (traces + std::to_string(++number)).c_str(), 1);
  };
  add("PrintDebug", [] {
    static const std::string long_text(5000, 't');
    PrintDebug(trace::kErrorLevel, "%s\n", "text");
    PrintDebug(trace::kErrorLevel, "%s\n", long_text.c_str());
    return read_ldap_debug() == 1;
  });
  add("PrintMessageCmdLine", [] { return PrintMessageCmdLine(20, 1, 53, 1, 1, "file") == 0; });
  add(kMeasure, [] {
    for (int i = 0; i < 3; ++i) (void)syscall(SYS_getppid);
    return true;
  });
  return points;
}

TEST_P(Points, LeaveNothingMoreWhenTheThreadIsCancelledThere) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer makes system calls of its own in the thread";
#endif
  if (!mayTraceChildren()) GTEST_SKIP() << "needs ptrace()";
  const TempDir temp;
  const std::string directory = temp.dir("calls");
  const PointCall point = pointCalls(directory, temp.path("more"))[GetParam()];
  setenv("TRC_DIR", temp.path("traces").c_str(), 1);
  setenv("TRC_EVENTS", "all", 1);
  int found = 0;
  const auto cancel = [&] {
    start(point, directory);
    found = HasFatalFailure() ? 0 : cancelEverywhere(point);
    printf("%d system calls\n", found);
    return 0;
  };
  if (point.call.enters == Enters::kResolver) {
    REQUIRE_ROOT("for hosts of its own");
    EXPECT_EQ(withPrivateNetwork([&] {
                writeFile("/etc/hosts", "127.0.0.1 localhost\n");
                return cancel();
              }),
              0);
  } else {
    (void)cancel();
  }
  RecordProperty("system_calls", found);
  if (point.call.symbols.front() == kMeasure) {
    EXPECT_EQ(found, 3);
  }
}

std::string nameOf(const testing::TestParamInfo<size_t>& info) {
  std::string name = pointCalls("", "")[info.param].call.symbols.front();
  std::erase(name, '*');
  return name;
}

INSTANTIATE_TEST_SUITE_P(Of, Points, testing::Range(size_t{0}, pointCalls("", "").size()), nameOf);

TEST(EveryExportedFunction, IsCancelledAtItsPoints) {
  EXPECT_THAT(symbolsWithoutCall(exportedCalls("")), testing::IsEmpty());
}

}  // namespace

// liborxldapdbg reads the switch when it is loaded.
int main(int argc, char** argv) {
  if (getenv("PRINT_DEBUG") == nullptr) {
    setenv("PRINT_DEBUG", "error", 1);
    execv("/proc/self/exe", argv);
  }
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
