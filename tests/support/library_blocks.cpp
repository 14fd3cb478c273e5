#include "library_blocks.h"

#include <link.h>
#include <stdarg.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <iterator>

#include "replaced.h"

extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* memory, size_t size);
void __libc_free(void* memory);
}

namespace {

struct Code {
  uintptr_t begin;
  uintptr_t end;
};
Code counted[3];
int objects = 0;

int findCode(dl_phdr_info* info, size_t, void*) {
  for (const char* const name : {"/libosutils.so", "/libvrastr.so", "/liborxldap.so"}) {
    if (strstr(info->dlpi_name, name) == nullptr) continue;
    for (int segment = 0; segment < info->dlpi_phnum; ++segment) {
      const ElfW(Phdr)& header = info->dlpi_phdr[segment];
      if (header.p_type != PT_LOAD || (header.p_flags & PF_X) == 0) continue;
      const uintptr_t begin = info->dlpi_addr + header.p_vaddr;
      counted[objects++] = {begin, begin + header.p_memsz};
    }
  }
  return 0;
}

bool isCounted(const void* caller) {
  const auto address = reinterpret_cast<uintptr_t>(caller);
  return std::any_of(counted, counted + objects,
                     [&](const Code& code) { return address >= code.begin && address < code.end; });
}

// A hash table: taking memory for it would change what is tested.
constexpr size_t kPlaces = 4096;
void* blocks[kPlaces];
char removed_block;
int count = 0;

// Returns the place of the block, or the first empty one.
void** placeOf(const void* block) {
  size_t place = reinterpret_cast<uintptr_t>(block) / 16 % kPlaces;
  while (blocks[place] != nullptr && blocks[place] != block) place = (place + 1) % kPlaces;
  return blocks + place;
}

void* added(void* block, const void* caller) {
  if (block == nullptr || !isCounted(caller)) return block;
  if (++count == static_cast<int>(kPlaces) / 2) abort();
  *placeOf(block) = block;
  return block;
}

void removed(const void* block) {
  if (block == nullptr || count == 0) return;
  void** const place = placeOf(block);
  if (*place == nullptr) return;
  *place = &removed_block;
  --count;
}

}  // namespace

int libraryBlocks() {
  if (objects == 0) {
    (void)dl_iterate_phdr(findCode, nullptr);
    if (objects != std::ssize(counted)) abort();
  }
  return count;
}

REPLACE(void*, malloc, (size_t size)) {
  return added(__libc_malloc(size), __builtin_return_address(0));
}
REPLACE(void*, calloc, (size_t number, size_t size)) {
  return added(__libc_calloc(number, size), __builtin_return_address(0));
}
REPLACE(void*, realloc, (void* block, size_t size)) {
  void* const moved = __libc_realloc(block, size);
  if (moved != nullptr || size == 0) removed(block);
  return added(moved, __builtin_return_address(0));
}
REPLACE(void, free, (void* block)) {
  removed(block);
  __libc_free(block);
}

// The functions of the C library that the library has memory allocated by.
REPLACE(char*, strdup, (const char* text)) {
  const size_t size = strlen(text) + 1;
  void* const copy = added(__libc_malloc(size), __builtin_return_address(0));
  return copy == nullptr ? nullptr : static_cast<char*>(memcpy(copy, text, size));
}
REPLACE(char*, getcwd, (char* buffer, size_t size)) {
  char* const path = REAL(getcwd)(buffer, size);
  if (buffer == nullptr) (void)added(path, __builtin_return_address(0));
  return path;
}

namespace {

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
int print(char** out, const char* format, va_list arguments, const void* caller) {
  va_list again;
  va_copy(again, arguments);
  const int length = vsnprintf(nullptr, 0, format, again);
  va_end(again);
  if (length < 0) return -1;
  const size_t size = static_cast<size_t>(length) + 1;
  *out = static_cast<char*>(added(__libc_malloc(size), caller));
  return *out == nullptr ? -1 : vsnprintf(*out, size, format, arguments);
}
#pragma GCC diagnostic pop

}  // namespace

REPLACE(int, vasprintf, (char** out, const char* format, va_list arguments)) {
  return print(out, format, arguments, __builtin_return_address(0));
}
// With _FORTIFY_SOURCE.
REPLACE(int, __vasprintf_chk, (char** out, int, const char* format, va_list arguments)) {
  return print(out, format, arguments, __builtin_return_address(0));
}
