// Preloaded into a program: its main thread handles a signal every 100 µs, with SA_RESTART if STORM_RESTARTS is set.

#include <signal.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

namespace {

__attribute__((constructor)) void begin() {
  struct sigaction action = {};
  action.sa_handler = [](int) {};
  action.sa_flags = getenv("STORM_RESTARTS") != nullptr ? SA_RESTART : 0;
  (void)sigaction(SIGUSR1, &action, nullptr);
  sigevent event = {};
  event.sigev_notify = SIGEV_THREAD_ID;
  event.sigev_signo = SIGUSR1;
  event._sigev_un._tid = static_cast<pid_t>(syscall(SYS_gettid));
  timer_t timer{};
  const itimerspec interval{{0, 100'000}, {0, 100'000}};
  // Not in the programs that it starts, which do not expect the signals that are already pending.
  (void)unsetenv("LD_PRELOAD");
  if (timer_create(CLOCK_MONOTONIC, &event, &timer) != 0 ||
      timer_settime(timer, 0, &interval, nullptr) != 0) {
    _exit(125);
  }
}

}  // namespace
