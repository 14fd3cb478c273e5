// For defining functions of the C library and of the platform in this test program.
#pragma once

#include <dlfcn.h>
#include <errno.h>
#include <stdio.h>

#include "faults.h"

#define EXPORTED extern "C" __attribute__((visibility("default")))

// Starts the definition of the C library's `name`, under another name in the source: it would clash
// with the noexcept declaration of the system header. The function that it replaces is looked up at
// the start of the program: a later dlsym() would release the text that dlerror() has returned.
#define REPLACE(result, name, parameters)                                                      \
  EXPORTED __attribute__((noinline)) result our_##name parameters __asm__(#name);              \
  static decltype(&our_##name) real_##name() {                                                 \
    static const auto real = reinterpret_cast<decltype(&our_##name)>(dlsym(RTLD_NEXT, #name)); \
    return real;                                                                               \
  }                                                                                            \
  __attribute__((constructor)) static void find_##name() { (void)real_##name(); }              \
  EXPORTED result our_##name parameters

// The function that would be called without the replacement.
#define REAL(name) real_##name()

// The error to fail with, if this call of the library must fail. Expands in the replacement itself,
// which is never inlined: only there the return address is that of the caller.
#define STRIKE(call) faults::strike(Call::call, __func__, __builtin_return_address(0))

// Whether the library makes this call. Likewise.
#define FROM_LIBRARY() faults::isLibrary(__builtin_return_address(0))

namespace faults {

bool isLibrary(const void* address);

// Lets calls of another shared object fail too, whose file's name begins with `name`, or of the
// program with "". Returns false if there is none.
bool addCaller(const char* name);
// Lets no calls of these callers fail.
void spareCallers();

// The error to fail with, if any. Not a std::optional, whose functions the linker may take from an
// instrumented source: a sanitizer calls the replacements before instrumented code can run.
struct Fault {
  bool strikes = false;
  int error = 0;
  explicit operator bool() const { return strikes; }
  int operator*() const { return error; }
};

// Counts the call, runs what a BeforeCall asked for, and returns the error to fail with, if any.
// `function` is the replacement's name.
Fault strike(Call call, const char* function, const void* caller);

// Sets errno and returns the value that stands for a failure.
template <typename Result>
Result failed(int error, Result result) {
  errno = error;
  return result;
}

// ferror() reads this flag of the stream; no public function sets it.
inline void setErrorFlag(FILE* stream) { stream->_flags |= 0x20; }

// Adds the memory to the table if the caller is the library. Returns it.
void* allocated(void* memory, const void* caller);

}  // namespace faults
