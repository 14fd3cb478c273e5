// Interrupts a thread at short intervals.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

// From construction until the end of the scope, the calling thread handles a signal every 100 µs. One at a time.
class SignalStorm {
 public:
  // `flags` are those of sigaction(): with SA_RESTART the kernel repeats most calls, without it they fail with EINTR.
  explicit SignalStorm(int flags) {
    handled_ = 0;
    struct sigaction action = {};
    action.sa_handler = [](int) { handled_ = handled_ + 1; };
    action.sa_flags = flags;
    EXPECT_EQ(sigaction(kSignal, &action, nullptr), 0);
    sigevent event = {};
    event.sigev_notify = SIGEV_THREAD_ID;
    event.sigev_signo = kSignal;
    event._sigev_un._tid = static_cast<pid_t>(syscall(SYS_gettid));
    EXPECT_EQ(timer_create(CLOCK_MONOTONIC, &event, &timer_), 0);
    const itimerspec interval{{0, 100'000}, {0, 100'000}};
    EXPECT_EQ(timer_settime(timer_, 0, &interval, nullptr), 0);
  }
  ~SignalStorm() {
    (void)timer_delete(timer_);
    // Discards a signal that is still pending.
    EXPECT_NE(signal(kSignal, SIG_IGN), SIG_ERR);
    EXPECT_NE(signal(kSignal, SIG_DFL), SIG_ERR);
  }
  SignalStorm(const SignalStorm&) = delete;
  SignalStorm& operator=(const SignalStorm&) = delete;

  // How many signals were handled.
  int handled() const { return handled_; }

 private:
  static constexpr int kSignal = SIGUSR1;
  static inline volatile sig_atomic_t handled_ = 0;
  timer_t timer_ = {};
};
