// Cancels threads in the middle of a call into the library.
#pragma once

#include <pthread.h>

#include <functional>

#include "faults.h"

// What became of such a thread.
struct CancelledCall {
  bool asked = false;     // the library made the call that the request was to come with
  bool returned = false;  // the function came back
  int blocks = 0;         // what it then had left allocated
  bool ended = false;     // the thread ended by the request
};

// Runs `body` in a thread of its own, which is asked to end right before the library's `nth` call
// of `call` there, and which ends at the latest when the body has come back. A cancellation that
// cannot unwind ends the process: use a child.
inline CancelledCall cancelledAt(Call call, int nth, const std::function<void()>& body) {
  struct Run {
    Call call;
    int nth;
    const std::function<void()>& body;
    CancelledCall result;
  } run{call, nth, body, {}};
  pthread_t thread;
  const auto start = [](void* argument) -> void* {
    Run& here = *static_cast<Run*>(argument);
    {
      const BeforeCall request(
          here.call,
          [&here] {
            here.result.asked = true;
            (void)pthread_cancel(pthread_self());
          },
          here.nth);
      const LiveAllocations memory;
      here.body();
      here.result.returned = true;
      here.result.blocks = memory.blocks();
    }
    pthread_testcancel();
    return nullptr;
  };
  void* answer = nullptr;
  if (pthread_create(&thread, nullptr, start, &run) != 0) return {};
  (void)pthread_join(thread, &answer);
  run.result.ended = answer == PTHREAD_CANCELED;
  return run.result;
}
