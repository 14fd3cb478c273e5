// The calls of libtrc that a test can replace. Each does what the C library's function does, as long as its
// `instead` is null.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <stdarg.h>
#include <stdint.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <sys/utsname.h>
#include <time.h>

#include <atomic>
#include <functional>
#include <map>
#include <string>
#include <string_view>

namespace instead {
inline bool no_memory = false;  // for operator new that returns null
inline int (*openat)(int, const char*, int, mode_t) = nullptr;
inline ssize_t (*write)(int, const void*, size_t) = nullptr;
inline ssize_t (*getrandom)(void*, size_t, unsigned int) = nullptr;
inline int (*getrlimit)(rlimit*) = nullptr;  // of the size of files
inline int (*renameat)(int, const char*, int, const char*) = nullptr;
inline int (*unlinkat)(int, const char*, int) = nullptr;
inline int (*fstat)(int, struct stat*) = nullptr;
inline int (*fstatfs)(int, struct statfs*) = nullptr;
inline int (*uname)(utsname*) = nullptr;
inline int (*clock_gettime)(clockid_t, timespec*) = nullptr;
inline int (*linkat)(int, const char*, int, const char*, int) = nullptr;
inline int (*renameat2)(int, const char*, int, const char*, unsigned int) = nullptr;
inline int (*ftruncate)(int, off_t) = nullptr;
inline void* (*mmap)(void*, size_t, int, int, int, off_t) = nullptr;
inline int (*munmap)(void*, size_t) = nullptr;
inline int (*madvise)(void*, size_t, int) = nullptr;
}  // namespace instead

// The C library's functions.
namespace real {
int openat(int directory, const char* path, int flags, mode_t mode);
ssize_t write(int descriptor, const void* data, size_t bytes);
int renameat(int from_directory, const char* from, int to_directory, const char* to);
int unlinkat(int directory, const char* path, int flags);
int fstat(int descriptor, struct stat* status);
int clock_gettime(clockid_t clock, timespec* time);
int munmap(void* at, size_t bytes);
int madvise(void* at, size_t bytes, int advice);
}  // namespace real

// A program that is run with this variable in its environment has this call of libtrc's constructor fail: "mmap",
// "pthread_key_create", "madvise" (as on a kernel without MADV_WIPEONFORK), or "fork handlers" (the latter two).
constexpr const char kFailingAtLoad[] = "TEST_FAILING_AT_LOAD";

// Replaces files and clocks in a child process; its parent does not notice.
namespace fake {
// What openat() opens in the place of these paths.
inline std::map<std::string, std::string, std::less<>> files;
inline std::atomic<uint64_t> monotonic{0};  // nanoseconds
inline std::atomic<int64_t> realtime{0};
inline std::atomic<int> clock_readings{0};  // of CLOCK_MONOTONIC
inline std::atomic<uint64_t> clock_step{
    0};  // what each reading adds to the counter, see fake::counter
inline std::atomic<uint64_t> counter{0};

constexpr const char kClockSource[] =
    "/sys/devices/system/clocksource/clocksource0/current_clocksource";
constexpr const char kBootId[] = "/proc/sys/kernel/random/boot_id";

inline int openFile(int directory, const char* path, int flags, mode_t mode) {
  const auto found = files.find(std::string_view(path));
  return real::openat(directory, found == files.end() ? path : found->second.c_str(), flags, mode);
}

inline int readClock(clockid_t clock, timespec* time) {
  int64_t now = realtime;
  if (clock == CLOCK_MONOTONIC) {
    ++clock_readings;
    counter += clock_step;
    now = static_cast<int64_t>(monotonic.load());
  }
  time->tv_sec = now / 1'000'000'000;
  time->tv_nsec = now % 1'000'000'000;
  return 0;
}

// From now on the time is what `monotonic` and `realtime` say, and the kernel's clock source is not the counter.
inline void useClock(uint64_t now) {
  monotonic = now;
  files[kClockSource] = "/dev/null";
  instead::openat = openFile;
  instead::clock_gettime = readClock;
}
}  // namespace fake
