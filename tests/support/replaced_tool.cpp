// The replaced functions that the library does not call: only the tool, the platform libraries and the
// C++ library do. Not part of every test, because they would stand in the way of a sanitizer.

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <locale.h>
#include <nl_types.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/random.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <new>

#include "replaced.h"

using faults::failed;

// ---- Files ----

namespace {

mode_t modeOf(int flags, va_list arguments) {
  return (flags & (O_CREAT | O_TMPFILE)) != 0 ? va_arg(arguments, mode_t) : 0;
}

}  // namespace

REPLACE(int, open, (const char* path, int flags, ...)) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = modeOf(flags, arguments);
  va_end(arguments);
  if (const auto error = STRIKE(open64)) return failed(*error, -1);
  return REAL(open)(path, flags, mode);
}

REPLACE(int, __open_2, (const char* path, int flags)) {
  if (const auto error = STRIKE(open64)) return failed(*error, -1);
  return REAL(__open_2)(path, flags);
}

REPLACE(int, openat, (int directory, const char* path, int flags, ...)) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = modeOf(flags, arguments);
  va_end(arguments);
  if (const auto error = STRIKE(open64)) return failed(*error, -1);
  return REAL(openat)(directory, path, flags, mode);
}

REPLACE(FILE*, fopen, (const char* path, const char* mode)) {
  if (const auto error = STRIKE(fopen64)) return failed<FILE*>(*error, nullptr);
  return REAL(fopen)(path, mode);
}

REPLACE(nl_catd, catopen, (const char* name, int flag)) {
  if (const auto error = STRIKE(open64)) {
    return failed(*error, reinterpret_cast<nl_catd>(static_cast<intptr_t>(-1)));
  }
  return REAL(catopen)(name, flag);
}

REPLACE(int, stat, (const char* path, struct stat* status)) {
  if (const auto error = STRIKE(stat64)) return failed(*error, -1);
  return REAL(stat)(path, status);
}

REPLACE(int, lstat, (const char* path, struct stat* status)) {
  if (const auto error = STRIKE(lstat64)) return failed(*error, -1);
  return REAL(lstat)(path, status);
}

REPLACE(int, fstat, (int descriptor, struct stat* status)) {
  if (const auto error = STRIKE(fstat64)) return failed(*error, -1);
  return REAL(fstat)(descriptor, status);
}

REPLACE(int, statvfs, (const char* path, struct statvfs* space)) {
  if (const auto error = STRIKE(statfs)) return failed(*error, -1);
  return REAL(statvfs)(path, space);
}

REPLACE(int, fstatvfs, (int descriptor, struct statvfs* space)) {
  if (const auto error = STRIKE(statfs)) return failed(*error, -1);
  return REAL(fstatvfs)(descriptor, space);
}

REPLACE(int, fstatfs, (int descriptor, struct statfs* space)) {
  if (const auto error = STRIKE(statfs)) return failed(*error, -1);
  return REAL(fstatfs)(descriptor, space);
}

REPLACE(int, access, (const char* path, int mode)) {
  if (const auto error = STRIKE(access)) return failed(*error, -1);
  return REAL(access)(path, mode);
}

REPLACE(int, faccessat, (int directory, const char* path, int mode, int flags)) {
  if (const auto error = STRIKE(access)) return failed(*error, -1);
  return REAL(faccessat)(directory, path, mode, flags);
}

REPLACE(ssize_t, pread, (int descriptor, void* buffer, size_t length, off_t offset)) {
  if (const auto error = STRIKE(read)) return failed<ssize_t>(*error, -1);
  return REAL(pread)(descriptor, buffer, length, offset);
}

REPLACE(ssize_t, pwrite, (int descriptor, const void* buffer, size_t length, off_t offset)) {
  if (const auto error = STRIKE(write)) return failed<ssize_t>(*error, -1);
  return REAL(pwrite)(descriptor, buffer, length, offset);
}

REPLACE(int, ftruncate, (int descriptor, off_t length)) {
  if (const auto error = STRIKE(ftruncate64)) return failed(*error, -1);
  return REAL(ftruncate)(descriptor, length);
}

REPLACE(int, fcntl, (int descriptor, int command, ...)) {
  va_list arguments;
  va_start(arguments, command);
  void* const argument = va_arg(arguments, void*);
  va_end(arguments);
  if (const auto error = STRIKE(fcntl)) return failed(*error, -1);
  return REAL(fcntl)(descriptor, command, argument);
}

REPLACE(int, isatty, (int descriptor)) {
  if (const auto error = STRIKE(isatty)) return failed(*error, 0);
  return REAL(isatty)(descriptor);
}

REPLACE(char*, realpath, (const char* path, char* resolved)) {
  if (const auto error = STRIKE(realpath)) return failed<char*>(*error, nullptr);
  return REAL(realpath)(path, resolved);
}

REPLACE(DIR*, fdopendir, (int descriptor)) {
  if (const auto error = STRIKE(opendir)) return failed<DIR*>(*error, nullptr);
  return REAL(fdopendir)(descriptor);
}

REPLACE(dirent*, readdir, (DIR * directory)) {
  if (const auto error = STRIKE(readdir)) return failed<dirent*>(*error, nullptr);
  return REAL(readdir)(directory);
}

REPLACE(int, mkdirat, (int directory, const char* path, mode_t mode)) {
  if (const auto error = STRIKE(mkdir)) return failed(*error, -1);
  return REAL(mkdirat)(directory, path, mode);
}

REPLACE(int, renameat, (int from_directory, const char* from, int to_directory, const char* to)) {
  if (const auto error = STRIKE(rename)) return failed(*error, -1);
  return REAL(renameat)(from_directory, from, to_directory, to);
}

REPLACE(int, renameat2,
        (int from_directory, const char* from, int to_directory, const char* to,
         unsigned int flags)) {
  if (const auto error = STRIKE(rename)) return failed(*error, -1);
  return REAL(renameat2)(from_directory, from, to_directory, to, flags);
}

REPLACE(int, linkat,
        (int from_directory, const char* from, int to_directory, const char* to, int flags)) {
  if (const auto error = STRIKE(symlink)) return failed(*error, -1);
  return REAL(linkat)(from_directory, from, to_directory, to, flags);
}

REPLACE(int, unlinkat, (int directory, const char* path, int flags)) {
  if (const auto error = STRIKE(unlink)) return failed(*error, -1);
  return REAL(unlinkat)(directory, path, flags);
}

// ---- Messages ----

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

REPLACE(int, fprintf, (FILE * stream, const char* format, ...)) {
  if (const auto error = stream == stderr ? STRIKE(message) : STRIKE(fwrite)) {
    return failed(*error, -1);
  }
  va_list arguments;
  va_start(arguments, format);
  const int length = vfprintf(stream, format, arguments);
  va_end(arguments);
  return length;
}

REPLACE(int, __fprintf_chk, (FILE * stream, int, const char* format, ...)) {
  if (const auto error = stream == stderr ? STRIKE(message) : STRIKE(fwrite)) {
    return failed(*error, -1);
  }
  va_list arguments;
  va_start(arguments, format);
  const int length = vfprintf(stream, format, arguments);
  va_end(arguments);
  return length;
}

// ---- Memory ----

REPLACE(int, vasprintf, (char** out, const char* format, va_list arguments)) {
  if (const auto error = STRIKE(vasprintf)) return failed(*error, -1);
  return REAL(vasprintf)(out, format, arguments);
}

REPLACE(int, __vasprintf_chk, (char** out, int, const char* format, va_list arguments)) {
  if (const auto error = STRIKE(vasprintf)) return failed(*error, -1);
  return REAL(vasprintf)(out, format, arguments);
}

REPLACE(int, asprintf, (char** out, const char* format, ...)) {
  if (const auto error = STRIKE(vasprintf)) return failed(*error, -1);
  va_list arguments;
  va_start(arguments, format);
  const int length = REAL(vasprintf)(out, format, arguments);
  va_end(arguments);
  return length;
}

#pragma GCC diagnostic pop

void* operator new(size_t size) {
  const bool fails = static_cast<bool>(STRIKE(malloc));
  void* const memory = fails ? nullptr : malloc(size);
  if (memory == nullptr) throw std::bad_alloc();
  return memory;
}

void* operator new(size_t size, const std::nothrow_t&) noexcept {
  return STRIKE(malloc) ? nullptr : malloc(size);
}

void operator delete(void* memory) noexcept { free(memory); }
void operator delete(void* memory, size_t) noexcept { free(memory); }

REPLACE(void*, mmap,
        (void* address, size_t length, int protection, int flags, int descriptor, off_t offset)) {
  if (const auto error = STRIKE(mmap)) return failed(*error, MAP_FAILED);
  return REAL(mmap)(address, length, protection, flags, descriptor, offset);
}

REPLACE(int, madvise, (void* address, size_t length, int advice)) {
  if (const auto error = STRIKE(madvise)) return failed(*error, -1);
  return REAL(madvise)(address, length, advice);
}

// ---- The process ----

REPLACE(int, setenv, (const char* name, const char* value, int overwrite)) {
  if (const auto error = STRIKE(setenv)) return failed(*error, -1);
  return REAL(setenv)(name, value, overwrite);
}

REPLACE(int, putenv, (char* assignment)) {
  if (const auto error = STRIKE(setenv)) return failed(*error, -1);
  return REAL(putenv)(assignment);
}

REPLACE(int, getrlimit, (__rlimit_resource_t resource, rlimit* limit)) {
  if (const auto error = STRIKE(getrlimit)) return failed(*error, -1);
  return REAL(getrlimit)(resource, limit);
}

REPLACE(ssize_t, getrandom, (void* buffer, size_t length, unsigned int flags)) {
  if (const auto error = STRIKE(getrandom)) return failed<ssize_t>(*error, -1);
  return REAL(getrandom)(buffer, length, flags);
}

REPLACE(locale_t, newlocale, (int mask, const char* name, locale_t base)) {
  if (const auto error = STRIKE(newlocale)) return failed<locale_t>(*error, nullptr);
  return REAL(newlocale)(mask, name, base);
}

REPLACE(int, pthread_key_create, (pthread_key_t * key, void (*destructor)(void*))) {
  if (const auto error = STRIKE(pthread_key_create)) return *error;
  return REAL(pthread_key_create)(key, destructor);
}

REPLACE(int, pthread_setspecific, (pthread_key_t key, const void* value)) {
  if (const auto error = STRIKE(pthread_key_create)) return *error;
  return REAL(pthread_setspecific)(key, value);
}

// ---- Sockets ----

REPLACE(int, bind, (int descriptor, const sockaddr* address, socklen_t length)) {
  if (const auto error = STRIKE(bind)) return failed(*error, -1);
  return REAL(bind)(descriptor, address, length);
}

REPLACE(int, setsockopt,
        (int descriptor, int level, int name, const void* value, socklen_t length)) {
  if (const auto error = STRIKE(setsockopt)) return failed(*error, -1);
  return REAL(setsockopt)(descriptor, level, name, value, length);
}
