#pragma once

#include <pthread.h>

// While it lives, the thread is not cancelled: a request takes effect at the next cancellation point after it.
class CancellationHeld {
 public:
  CancellationHeld() { (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &before_); }
  ~CancellationHeld() { (void)pthread_setcancelstate(before_, nullptr); }
  CancellationHeld(const CancellationHeld&) = delete;
  CancellationHeld& operator=(const CancellationHeld&) = delete;

 private:
  int before_;
};
