// Calls the library in a thread with the smallest possible stack.
#pragma once

#include <limits.h>
#include <pthread.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <functional>

// Runs `body` in such a thread. Returns false if it overran its stack or could not be run.
inline bool keepsToASmallStack(const std::function<void()>& body) {
  constexpr size_t kBelow = 256 * 1024;
  constexpr unsigned char kUntouched = 0xA5;
  const size_t stack =
      std::max<size_t>(16 * 1024, static_cast<size_t>(sysconf(_SC_THREAD_STACK_MIN)));
  void* const memory = mmap(nullptr, kBelow + stack, PROT_READ | PROT_WRITE,
                            MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
  if (memory == MAP_FAILED) return false;
  auto* const below = static_cast<unsigned char*>(memory);
  memset(below, kUntouched, kBelow);

  pthread_attr_t attributes;
  pthread_t thread;
  const auto run = [](void* argument) -> void* {
    (*static_cast<const std::function<void()>*>(argument))();
    return nullptr;
  };
  bool kept =
      pthread_attr_init(&attributes) == 0 &&
      pthread_attr_setstack(&attributes, below + kBelow, stack) == 0 &&
      pthread_create(&thread, &attributes, run, const_cast<std::function<void()>*>(&body)) == 0;
  kept = kept && pthread_join(thread, nullptr) == 0 &&
         std::all_of(below, below + kBelow, [](unsigned char byte) { return byte == kUntouched; });
  (void)munmap(memory, kBelow + stack);
  return kept;
}
