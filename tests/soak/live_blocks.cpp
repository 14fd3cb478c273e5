#include "live_blocks.h"

#include <errno.h>
#include <malloc.h>
#include <stddef.h>

#include <atomic>

extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* memory, size_t size);
void* __libc_memalign(size_t alignment, size_t size);
void __libc_free(void* memory);
}

namespace {

constinit thread_local long blocks_of_thread = 0;
constinit std::atomic<long> live_blocks = 0;
constinit std::atomic<long> live_bytes = 0;

void count(void* memory, long blocks) {
  blocks_of_thread += blocks;
  live_blocks.fetch_add(blocks, std::memory_order_relaxed);
  live_bytes.fetch_add(blocks * static_cast<long>(malloc_usable_size(memory)),
                       std::memory_order_relaxed);
}

void* allocated(void* memory) {
  if (memory != nullptr) count(memory, 1);
  return memory;
}

}  // namespace

long blocksOfThread() { return blocks_of_thread; }
long liveBlocks() { return live_blocks.load(std::memory_order_relaxed); }
long liveBytes() { return live_bytes.load(std::memory_order_relaxed); }

extern "C" {

void* malloc(size_t size) noexcept { return allocated(__libc_malloc(size)); }

void* calloc(size_t count, size_t size) noexcept { return allocated(__libc_calloc(count, size)); }

void* realloc(void* memory, size_t size) noexcept {
  if (memory != nullptr) count(memory, -1);
  void* const moved = __libc_realloc(memory, size);
  if (moved == nullptr && memory != nullptr && size != 0) count(memory, 1);  // it stays
  return allocated(moved);
}

void* memalign(size_t alignment, size_t size) noexcept {
  return allocated(__libc_memalign(alignment, size));
}

void* aligned_alloc(size_t alignment, size_t size) noexcept { return memalign(alignment, size); }

int posix_memalign(void** out, size_t alignment, size_t size) noexcept {
  void* const memory = memalign(alignment, size);
  if (memory == nullptr) return ENOMEM;
  *out = memory;
  return 0;
}

void free(void* memory) noexcept {
  if (memory != nullptr) count(memory, -1);
  __libc_free(memory);
}

}  // extern "C"
