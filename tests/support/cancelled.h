// Cancels threads in the middle of a call into the library.
#pragma once

#include <pthread.h>
#include <sys/mman.h>

#include <functional>

#include "faults.h"

// AddressSanitizer leaves the frames of a cancelled thread poisoned.
extern "C" void __asan_unpoison_memory_region(const volatile void* memory, size_t size)
    __attribute__((weak));

struct StackOfThread {
  void* memory;
  size_t bytes;
  ~StackOfThread() {
    if (__asan_unpoison_memory_region != nullptr) __asan_unpoison_memory_region(memory, bytes);
  }
};

// The outcome of a cancellation.
struct CancelledCall {
  bool asked = false;     // the library made the call
  bool returned = false;  // the function returned
  int blocks = 0;         // allocated by the function and not freed
  bool ended = false;     // the thread ended by cancellation
};

// Runs `body` in a new thread and cancels that thread right before the library's `nth` call of `call`. The
// thread ends at the latest when the body returns. A cancellation that cannot unwind ends the process: use
// a child process.
inline CancelledCall cancelledAt(Call call, int nth, const std::function<void()>& body) {
  constexpr size_t kStackBytes = 1024 * 1024;
  struct Run {
    Call call;
    int nth;
    const std::function<void()>& body;
    void* stack;
    CancelledCall result;
  } run{call, nth, body, nullptr, {}};
  pthread_t thread;
  const auto start = [](void* argument) -> void* {
    Run& here = *static_cast<Run*>(argument);
    const StackOfThread unmarked_at_the_end{here.stack, kStackBytes};
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
  run.stack =
      mmap(nullptr, kStackBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (run.stack == MAP_FAILED) return {};
  pthread_attr_t attributes;
  (void)pthread_attr_init(&attributes);
  (void)pthread_attr_setstack(&attributes, run.stack, kStackBytes);
  void* answer = nullptr;
  if (pthread_create(&thread, &attributes, start, &run) == 0) (void)pthread_join(thread, &answer);
  (void)pthread_attr_destroy(&attributes);
  (void)munmap(run.stack, kStackBytes);
  run.result.ended = answer == PTHREAD_CANCELED;
  return run.result;
}
