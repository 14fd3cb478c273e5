// The replaced functions of the dynamic loader. Not part of every test, because they would stand in the
// way of a sanitizer.

#include <dlfcn.h>

#include "replaced.h"

using faults::failed;

// The loader searches the run path of this program, and no longer that of the caller.
REPLACE(void*, dlopen, (const char* file, int flags)) {
  if (const auto error = STRIKE(dlopen)) return failed<void*>(*error, nullptr);
  return REAL(dlopen)(file, flags);
}

REPLACE(void*, dlsym, (void* library, const char* name)) {
  if (const auto error = STRIKE(dlsym)) return failed<void*>(*error, nullptr);
  static const auto real =
      reinterpret_cast<decltype(&our_dlsym)>(dlvsym(RTLD_NEXT, "dlsym", "GLIBC_2.34"));
  return real(library, name);
}
