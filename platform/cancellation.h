// Whether the calling thread may be cancelled, for a scope that must not be left half way.
#pragma once

#include <pthread.h>

namespace osutils {

// Sets the thread's cancellation state, and puts the old one back at the end of the scope. A
// request that arrives while it is PTHREAD_CANCEL_DISABLE takes effect at the thread's next
// cancellation point after the scope.
class CancellationState {
 public:
  explicit CancellationState(int state) { (void)pthread_setcancelstate(state, &before_); }
  // May unwind: a thread with asynchronous cancellation ends here.
  ~CancellationState() noexcept(false) { (void)pthread_setcancelstate(before_, nullptr); }
  CancellationState(const CancellationState&) = delete;
  CancellationState& operator=(const CancellationState&) = delete;

  int before() const { return before_; }

 private:
  int before_ = PTHREAD_CANCEL_ENABLE;
};

}  // namespace osutils
