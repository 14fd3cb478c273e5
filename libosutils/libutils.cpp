// Loading shared libraries at run time.

#include <dlfcn.h>
#include <stdlib.h>

#include "cancellation.h"
#include "osutils.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::TraceScope;

struct SharedLibHandle {
  void* handle;
};

namespace {

const char* orNull(const char* text) { return text != nullptr ? text : "(null)"; }

}  // namespace

int defFlags = RTLD_NOW | RTLD_GLOBAL;

TRACED SharedLibHandle* loadSharedLib(const char* fileName, int mode) {
  TraceScope<traced::loadSharedLib> trace;
  // A thread cancelled in a library's constructor would leave the loader's mutex locked.
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  auto* const lib = static_cast<SharedLibHandle*>(malloc(sizeof(SharedLibHandle)));
  // sic: reported, but not refused, because dlopen(nullptr) opens the program itself.
  if (fileName == nullptr) DEBUG_MESSAGE(trace, "loadSharedLib: passed a null pointer.\n");
  if (lib == nullptr) {
    DEBUG_MESSAGE(trace, "loadSharedLib: unable to allocate memory.\n");
    return nullptr;
  }
  if (mode == 0) mode = defFlags;
  lib->handle = dlopen(fileName, mode);
  if (lib->handle == nullptr) {
    // sic: names ldapLoadLib.
    // dlerror() clears the error, so it is called only if the message is written.
    ERROR_MESSAGE(trace, "ldapLoadLib: dlopen(%s,%d) failed with error: %s.\n", orNull(fileName),
                  mode, orNull(dlerror()));
    free(lib);
    return nullptr;
  }
  return lib;
}

TRACED int unloadSharedLib(SharedLibHandle* lib) {
  TraceScope<traced::unloadSharedLib> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (lib == nullptr) {
    DEBUG_MESSAGE(trace, "unloadSharedLib: passed a null pointer.\n");
    return OSUTILS_OTHER;
  }
  (void)dlclose(lib->handle);
  lib->handle = nullptr;
  free(lib);
  return OSUTILS_SUCCESS;
}

TRACED void* getSymAddress(SharedLibHandle* lib, const char* symbolName) {
  TraceScope<traced::getSymAddress> trace;

  if (lib == nullptr || symbolName == nullptr) {
    DEBUG_MESSAGE(trace, "getSymAddress: passed a null pointer.\n");
    return nullptr;
  }
  return dlsym(lib->handle, symbolName);
}
