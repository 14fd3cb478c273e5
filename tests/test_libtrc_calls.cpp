// Compiled without a sanitizer, whose runtime makes some of these calls before instrumented code can run.
#include "test_libtrc_calls.h"

#include <dlfcn.h>
#include <errno.h>
#include <pthread.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/random.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <new>

namespace {

template <typename Function>
Function* next(const char* name) {
  return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

// Whether this call, from `caller`, is one that fails while libtrc is loaded.
bool failsAtLoad(const char* call, const void* caller) {
  const char* failing = getenv(kFailingAtLoad);
  if (failing == nullptr) return false;
  for (; *failing != '\0' && *failing == *call; ++failing) ++call;  // a sanitizer replaces strcmp()
  Dl_info library;
  return *failing == *call && dladdr(caller, &library) != 0 &&
         strstr(library.dli_fname, "/libtrc.so") != nullptr;
}

}  // namespace

namespace real {
int openat(int directory, const char* path, int flags, mode_t mode) {
  return static_cast<int>(syscall(SYS_openat, directory, path, flags | O_LARGEFILE, mode));
}
ssize_t write(int descriptor, const void* data, size_t bytes) {
  return syscall(SYS_write, descriptor, data, bytes);
}
int renameat(int from_directory, const char* from, int to_directory, const char* to) {
  static auto* const call = next<int(int, const char*, int, const char*)>("renameat");
  return call(from_directory, from, to_directory, to);
}
int unlinkat(int directory, const char* path, int flags) {
  return static_cast<int>(syscall(SYS_unlinkat, directory, path, flags));
}
int fstat(int descriptor, struct stat* status) {
  static auto* const call = next<int(int, struct stat*)>("fstat");
  return call(descriptor, status);
}
int clock_gettime(clockid_t clock, timespec* time) {
  static auto* const call = next<int(clockid_t, timespec*)>("clock_gettime");
  return call(clock, time);
}
int munmap(void* at, size_t bytes) {
  static auto* const call = next<int(void*, size_t)>("munmap");
  return call(at, bytes);
}
int madvise(void* at, size_t bytes, int advice) {
  static auto* const call = next<int(void*, size_t, int)>("madvise");
  return call(at, bytes, advice);
}
}  // namespace real

#define REPLACEABLE extern "C" __attribute__((visibility("default")))

REPLACEABLE int openat(int directory, const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  auto* const other = instead::openat;
  return (other != nullptr ? other : real::openat)(directory, path, flags, mode);
}

REPLACEABLE ssize_t write(int descriptor, const void* data, size_t bytes) {
  auto* const other = instead::write;
  return (other != nullptr ? other : real::write)(descriptor, data, bytes);
}

REPLACEABLE ssize_t getrandom(void* out, size_t bytes, unsigned int flags) {
  auto* const other = instead::getrandom;
  return other != nullptr ? other(out, bytes, flags) : syscall(SYS_getrandom, out, bytes, flags);
}

REPLACEABLE int getrlimit(__rlimit_resource_t resource, rlimit* limit) noexcept {
  if (instead::getrlimit != nullptr && resource == RLIMIT_FSIZE) return instead::getrlimit(limit);
  return static_cast<int>(syscall(SYS_prlimit64, 0, resource, nullptr, limit));
}

REPLACEABLE int renameat(int from_directory, const char* from, int to_directory,
                         const char* to) noexcept {
  auto* const other = instead::renameat;
  return (other != nullptr ? other : real::renameat)(from_directory, from, to_directory, to);
}

REPLACEABLE int unlinkat(int directory, const char* path, int flags) noexcept {
  auto* const other = instead::unlinkat;
  return (other != nullptr ? other : real::unlinkat)(directory, path, flags);
}

REPLACEABLE int fstat(int descriptor, struct stat* status) noexcept {
  auto* const other = instead::fstat;
  return (other != nullptr ? other : real::fstat)(descriptor, status);
}

REPLACEABLE int fstatfs(int descriptor, struct statfs* file_system) noexcept {
  auto* const other = instead::fstatfs;
  return other != nullptr ? other(descriptor, file_system)
                          : static_cast<int>(syscall(SYS_fstatfs, descriptor, file_system));
}

REPLACEABLE int uname(utsname* name) noexcept {
  auto* const other = instead::uname;
  return other != nullptr ? other(name) : static_cast<int>(syscall(SYS_uname, name));
}

REPLACEABLE int clock_gettime(clockid_t clock, timespec* time) noexcept {
  auto* const other = instead::clock_gettime;
  return (other != nullptr ? other : real::clock_gettime)(clock, time);
}

REPLACEABLE int linkat(int from_directory, const char* from, int to_directory, const char* to,
                       int flags) noexcept {
  if (auto* const other = instead::linkat)
    return other(from_directory, from, to_directory, to, flags);
  return static_cast<int>(syscall(SYS_linkat, from_directory, from, to_directory, to, flags));
}

REPLACEABLE int renameat2(int from_directory, const char* from, int to_directory, const char* to,
                          unsigned int flags) noexcept {
  if (auto* const other = instead::renameat2)
    return other(from_directory, from, to_directory, to, flags);
  return static_cast<int>(syscall(SYS_renameat2, from_directory, from, to_directory, to, flags));
}

REPLACEABLE int ftruncate(int descriptor, off_t bytes) noexcept {
  if (auto* const other = instead::ftruncate) return other(descriptor, bytes);
  return static_cast<int>(syscall(SYS_ftruncate, descriptor, bytes));
}

REPLACEABLE void* mmap(void* at, size_t bytes, int protection, int flags, int file,
                       off_t offset) noexcept {
  if (failsAtLoad("mmap", __builtin_return_address(0))) {
    errno = ENOMEM;
    return MAP_FAILED;
  }
  static auto* const call = next<void*(void*, size_t, int, int, int, off_t)>("mmap");
  auto* const other = instead::mmap;
  return (other != nullptr ? other : call)(at, bytes, protection, flags, file, offset);
}

REPLACEABLE int munmap(void* at, size_t bytes) noexcept {
  auto* const other = instead::munmap;
  return (other != nullptr ? other : real::munmap)(at, bytes);
}

REPLACEABLE int madvise(void* at, size_t bytes, int advice) noexcept {
  const void* const caller = __builtin_return_address(0);
  if (advice == MADV_WIPEONFORK &&
      (failsAtLoad("madvise", caller) || failsAtLoad("fork handlers", caller))) {
    errno = EINVAL;
    return -1;
  }
  auto* const other = instead::madvise;
  return (other != nullptr ? other : real::madvise)(at, bytes, advice);
}

REPLACEABLE int pthread_key_create(pthread_key_t* key, void (*destructor)(void*)) noexcept {
  if (failsAtLoad("pthread_key_create", __builtin_return_address(0))) return EAGAIN;
  static auto* const call = next<int(pthread_key_t*, void (*)(void*))>("pthread_key_create");
  return call(key, destructor);
}

__attribute__((visibility("default"))) void* operator new(size_t bytes,
                                                          const std::nothrow_t&) noexcept {
  if (instead::no_memory) return nullptr;
  try {
    return operator new(bytes);
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

// What pthread_atfork() calls.
REPLACEABLE int __register_atfork(void (*prepare)(), void (*parent)(), void (*child)(),
                                  void* library) noexcept {
  if (failsAtLoad("fork handlers", __builtin_return_address(0))) return ENOMEM;
  static auto* const call =
      next<int(void (*)(), void (*)(), void (*)(), void*)>("__register_atfork");
  return call(prepare, parent, child, library);
}
