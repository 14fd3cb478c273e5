// How this test program defines functions of the C library and of the platform itself.
#pragma once

#include <dlfcn.h>
#include <errno.h>
#include <stdio.h>

#include <optional>

#include "faults.h"

#define EXPORTED extern "C" __attribute__((visibility("default")))

// Begins the definition of the C library's `name`. It has a name of its own here, so that the
// system headers' noexcept declaration does not clash.
#define REPLACE(result, name, parameters)                                         \
  EXPORTED __attribute__((noinline)) result our_##name parameters __asm__(#name); \
  EXPORTED result our_##name parameters

// The function that would have been called without us.
#define REAL(name)                                                                             \
  ([] {                                                                                        \
    static const auto real = reinterpret_cast<decltype(&our_##name)>(dlsym(RTLD_NEXT, #name)); \
    return real;                                                                               \
  }())

// The error to fail with, when this call of the library must fail. Expands in the replacement
// itself, which is never inlined: the caller is known there only.
#define STRIKE(call) faults::strike(Call::call, __builtin_return_address(0))

// Whether it is the library that calls. Likewise.
#define FROM_LIBRARY() faults::isLibrary(__builtin_return_address(0))

namespace faults {

bool isLibrary(const void* address);

// Counts the call, runs what is to be run before it, and returns the error that it must fail with.
std::optional<int> strike(Call call, const void* caller);

// Sets errno to the error and returns the value that tells the caller to look at it.
template <typename Result>
Result failed(int error, Result result) {
  errno = error;
  return result;
}

// The C library keeps this flag in the stream; ferror() reads it, nothing public sets it.
inline void setErrorFlag(FILE* stream) { stream->_flags |= 0x20; }

// Counts the memory as the library's if it is the library that calls. Returns it.
void* allocated(void* memory, const void* caller);

}  // namespace faults
