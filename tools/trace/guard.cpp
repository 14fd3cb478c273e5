#include "guard.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <sys/prctl.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <string>

namespace traces {
namespace {

// Signals of a crash; glib ends with SIGTRAP, and the timer below with SIGPROF.
constexpr int kCrashes[] = {SIGABRT, SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGPROF};
// Signals from elsewhere that end the process.
constexpr int kEnds[] = {SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGALRM, SIGXCPU, SIGUSR1, SIGUSR2};

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kOwnsSignalsAndMemory = false;
#else
constexpr bool kOwnsSignalsAndMemory = true;
#endif

char last_line[4096];
size_t last_line_size = 0;

void onCrash(int) {
  PartOfFolder::removePresent();
  (void)!write(STDERR_FILENO, last_line, last_line_size);
  _exit(3);
}

void onEnd(int signal) {
  PartOfFolder::removePresent();
  (void)raise(signal);  // takes effect after the handler, whose signal has its default action again
}

void setHandlers(void (*on_crash)(int), void (*on_end)(int)) {
  struct sigaction action = {};
  action.sa_handler = on_crash;
  action.sa_flags = SA_ONSTACK;
  for (const int signal : kCrashes) {
    if (kOwnsSignalsAndMemory) (void)sigaction(signal, &action, nullptr);
  }
  action.sa_handler = on_end;
  action.sa_flags = static_cast<int>(SA_RESETHAND);
  for (const int signal : kEnds) {
    struct sigaction now = {};
    const bool is_ignored = sigaction(signal, nullptr, &now) != 0 || now.sa_handler == SIG_IGN;
    if (!is_ignored) (void)sigaction(signal, &action, nullptr);
  }
}

void setTimer(time_t seconds) {
  const itimerval timer = {{0, 0}, {seconds, 0}};
  (void)setitimer(ITIMER_PROF, &timer, nullptr);
}

// The address space that the process uses, from /proc/self/statm.
rlim_t usedMemory() {
  FILE* const file = fopen("/proc/self/statm", "re");
  unsigned long pages = 0;
  const bool is_read = file != nullptr && fscanf(file, "%lu", &pages) == 1;
  if (file != nullptr) (void)fclose(file);
  return is_read ? pages * static_cast<rlim_t>(sysconf(_SC_PAGESIZE)) : 0;
}

}  // namespace

Guard::Guard(const std::string& folder) {
  const std::string text = "osutils: trace: libbabeltrace2 fails over " + folder + '\n';
  last_line_size = text.copy(last_line, sizeof last_line);
  // A crash may be an overflow of the stack.
  static std::array<char, size_t{64} * 1024> stack;
  stack_t alternate = {};
  alternate.ss_sp = stack.data();
  alternate.ss_size = stack.size();
  if (kOwnsSignalsAndMemory) (void)sigaltstack(&alternate, nullptr);
  setHandlers(onCrash, onEnd);
}

Guard::~Guard() { setHandlers(SIG_DFL, SIG_DFL); }

size_t callsSurvived(size_t calls, const std::function<void(size_t)>& function) {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) return calls;  // nothing is known
  const pid_t child = fork();
  if (child == 0) {
    const Guard guard("");
    (void)prctl(PR_SET_PDEATHSIG, SIGTERM);  // whose handler removes a PartOfFolder
    last_line_size = 0;
    for (size_t i = 0; i < calls; ++i) {
      try {
        function(i);
      } catch (...) {  // the parent process will see it, too
      }
      if (write(ends[1], "", 1) != 1) break;
    }
    _exit(0);
  }
  (void)close(ends[1]);
  size_t survived = child == -1 ? calls : 0;
  char bytes[64];
  ssize_t size = 0;
  while ((size = ::read(ends[0], bytes, sizeof bytes)) > 0 || (size == -1 && errno == EINTR)) {
    if (size > 0) survived += static_cast<size_t>(size);
  }
  (void)close(ends[0]);
  while (child != -1 && waitpid(child, nullptr, 0) == -1 && errno == EINTR) {
  }
  return survived;
}

Limits::Limits(const Folder& folder) {
  const uint64_t packets = folder.files.size() + folder.bytes / 4096;
  setTimer(static_cast<time_t>(10 + folder.files.size() / 1000 + packets / 50'000));
  if (!kOwnsSignalsAndMemory || getrlimit(RLIMIT_AS, &memory_) != 0) return;
  rlimit limit = memory_;
  const rlim_t used = usedMemory();
  if (used == 0) return;
  limit.rlim_cur = std::min<rlim_t>(
      limit.rlim_max, used + (rlim_t{1} << 30) + folder.files.size() * 16'384 + packets * 256);
  limit.rlim_cur = std::min(limit.rlim_cur, memory_.rlim_cur);
  (void)setrlimit(RLIMIT_AS, &limit);
}

Limits::~Limits() {
  setTimer(0);
  if (memory_.rlim_cur != 0) (void)setrlimit(RLIMIT_AS, &memory_);
}

}  // namespace traces
