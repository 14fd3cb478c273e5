// The replaced functions that allocate memory, and the table of what they allocated.

#include <pthread.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <atomic>
#include <mutex>
#include <new>
#include <unordered_map>
#include <utility>

#include "replaced.h"

using faults::failed;

#ifdef SANITIZER_OWNS_MALLOC

bool sanitizerOwnsMalloc() { return true; }

void* faults::allocated(void* memory, const void*) { return memory; }

LiveAllocations::LiveAllocations() : first_(0) {}
LiveAllocations::~LiveAllocations() = default;
int LiveAllocations::blocks() const { return static_cast<int>(first_); }

#else

extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* memory, size_t size);
void __libc_free(void* memory);
}

namespace {

// The table must not use the replaced functions.
template <typename T>
struct LibcAllocator {
  using value_type = T;
  LibcAllocator() = default;
  template <typename U>
  explicit(false) LibcAllocator(const LibcAllocator<U>&) {}
  T* allocate(size_t count) { return static_cast<T*>(__libc_malloc(count * sizeof(T))); }
  void deallocate(T* memory, size_t) { __libc_free(memory); }
  template <typename U>
  bool operator==(const LibcAllocator<U>&) const {
    return true;
  }
};

struct Allocation {
  pthread_t thread;
  long number;
};

std::atomic<int> watchers = 0;
long allocations = 0;  // numbers them; guarded, as the table is, by the mutex
std::mutex live_mutex;
using LiveTable = std::unordered_map<void*, Allocation, std::hash<void*>, std::equal_to<>,
                                     LibcAllocator<std::pair<void* const, Allocation> > >;
// Never destroyed: memory is also freed after the last destructor.
LiveTable& live() {
  alignas(LiveTable) static char place[sizeof(LiveTable)];
  static LiveTable* const table = new (place) LiveTable;
  return *table;
}

void freed(void* memory) {
  if (memory != nullptr && watchers > 0) {
    const std::lock_guard lock(live_mutex);
    live().erase(memory);
  }
}

}  // namespace

void* faults::allocated(void* memory, const void* caller) {
  if (memory != nullptr && watchers > 0 && isLibrary(caller)) {
    const std::lock_guard lock(live_mutex);
    live()[memory] = {pthread_self(), ++allocations};
  }
  return memory;
}

bool sanitizerOwnsMalloc() { return false; }

LiveAllocations::LiveAllocations() {
  ++watchers;
  const std::lock_guard lock(live_mutex);
  first_ = allocations;
}
LiveAllocations::~LiveAllocations() {
  if (--watchers == 0) {
    const std::lock_guard lock(live_mutex);
    live().clear();
  }
}
int LiveAllocations::blocks() const {
  const std::lock_guard lock(live_mutex);
  int count = 0;
  for (const auto& [memory, allocation] : live()) {
    if (allocation.number > first_ && pthread_equal(allocation.thread, pthread_self())) ++count;
  }
  return count;
}

REPLACE(void*, malloc, (size_t size)) {
  if (const auto error = STRIKE(malloc)) return failed<void*>(*error, nullptr);
  return faults::allocated(__libc_malloc(size), __builtin_return_address(0));
}

REPLACE(void*, calloc, (size_t count, size_t size)) {
  if (const auto error = STRIKE(calloc)) return failed<void*>(*error, nullptr);
  return faults::allocated(__libc_calloc(count, size), __builtin_return_address(0));
}

REPLACE(void*, realloc, (void* memory, size_t size)) {
  if (const auto error = STRIKE(realloc)) return failed<void*>(*error, nullptr);
  freed(memory);
  return faults::allocated(__libc_realloc(memory, size), __builtin_return_address(0));
}

REPLACE(char*, strdup, (const char* text)) {
  if (const auto error = STRIKE(strdup)) return failed<char*>(*error, nullptr);
  const size_t size = strlen(text) + 1;
  void* const copy = faults::allocated(__libc_malloc(size), __builtin_return_address(0));
  return copy == nullptr ? nullptr : static_cast<char*>(memcpy(copy, text, size));
}

REPLACE(void, free, (void* memory)) {
  freed(memory);
  __libc_free(memory);
}

#endif

REPLACE(char*, getcwd, (char* buffer, size_t size)) {
  if (const auto error = STRIKE(getcwd)) return failed<char*>(*error, nullptr);
  char* const path = REAL(getcwd)(buffer, size);
  if (buffer == nullptr) (void)faults::allocated(path, __builtin_return_address(0));
  return path;
}
