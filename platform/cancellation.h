// A thread's cancellation state for a scope.
#pragma once

#include <pthread.h>

namespace osutils {

// Sets the thread's cancellation state, and restores the old one at the end of the scope. With PTHREAD_CANCEL_DISABLE,
// a cancellation request takes effect at the first cancellation point after the scope.
class CancellationState {
 public:
  explicit CancellationState(int state) { (void)pthread_setcancelstate(state, &previous_); }
  // Unwinds if an asynchronous cancellation is pending.
  ~CancellationState() noexcept(false) { (void)pthread_setcancelstate(previous_, nullptr); }
  CancellationState(const CancellationState&) = delete;
  CancellationState& operator=(const CancellationState&) = delete;

  int previous() const { return previous_; }

 private:
  int previous_ = PTHREAD_CANCEL_ENABLE;
};

}  // namespace osutils
