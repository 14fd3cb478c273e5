#include "faults.h"

#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <link.h>
#include <netdb.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/vfs.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform.h"

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
#define STRIKE(call) strike(Call::call, __builtin_return_address(0))

// Whether it is the library that calls. Likewise.
#define FROM_LIBRARY() isLibrary(__builtin_return_address(0))

namespace {

// ---- who calls ----

struct Range {
  uintptr_t begin = 0;
  uintptr_t end = 0;
};

int findLibrary(dl_phdr_info* info, size_t, void* result) {
  const char* const slash = strrchr(info->dlpi_name, '/');
  const char* const name = slash == nullptr ? info->dlpi_name : slash + 1;
  if (strncmp(name, "libosutils.so", strlen("libosutils.so")) != 0) return 0;
  for (int segment = 0; segment < info->dlpi_phnum; ++segment) {
    const ElfW(Phdr)& header = info->dlpi_phdr[segment];
    if (header.p_type == PT_LOAD && (header.p_flags & PF_X) != 0) {
      const uintptr_t begin = info->dlpi_addr + header.p_vaddr;
      *static_cast<Range*>(result) = {begin, begin + header.p_memsz};
    }
  }
  return 1;
}

// The library's code. Empty until this program's constructors run, and nothing fails before.
constinit Range library;
__attribute__((constructor)) void locateLibrary() {
  dl_iterate_phdr(findLibrary, &library);
  if (library.begin == library.end) {
    fputs("this program does not use libosutils.so\n", stderr);
    abort();
  }
}

bool isLibrary(const void* address) {
  const auto value = reinterpret_cast<uintptr_t>(address);
  return value >= library.begin && value < library.end;
}

// ---- what a thread has asked for ----

struct Slot {
  bool used;
  Call call;
  bool armed;
  int error;
  int nth;
  int times;
  const std::function<void()>* during;
  int calls;
  bool fired;
};

constexpr int kSlots = 16;
constinit thread_local Slot slots[kSlots] = {};

int takeSlot(Slot wanted) {
  for (int slot = 0; slot < kSlots; ++slot) {
    if (!slots[slot].used) {
      slots[slot] = wanted;
      return slot;
    }
  }
  fputs("too many faults at once\n", stderr);
  abort();
}

bool isAllocation(Call call) {
  return call == Call::malloc || call == Call::calloc || call == Call::realloc ||
         call == Call::strdup;
}

std::optional<int> strike(Call call, const void* caller) {
  if (!isLibrary(caller)) return std::nullopt;
  std::optional<int> error;
  for (Slot& slot : slots) {
    if (!slot.used) continue;
    if (slot.call != call && slot.call != Call::any &&
        !(slot.call == Call::allocation && isAllocation(call))) {
      continue;
    }
    ++slot.calls;
    if (!slot.armed || slot.calls < slot.nth || slot.calls - slot.nth >= slot.times) continue;
    slot.fired = true;
    if (slot.during != nullptr) {
      const int saved = errno;
      (*slot.during)();
      errno = saved;
    } else if (!error) {
      error = slot.error;
    }
  }
  return error;
}

// Sets errno to the error and returns the value that tells the caller to look at it.
template <typename Result>
Result failed(int error, Result result) {
  errno = error;
  return result;
}

// The C library keeps this flag in the stream; ferror() reads it, nothing public sets it.
void setErrorFlag(FILE* stream) { stream->_flags |= 0x20; }

// ---- nanosleep ----

std::atomic<bool> sleep_is_fake = false;
std::atomic<int> sleep_calls = 0;
std::atomic<long long> slept_microseconds = 0;

// ---- system, gettimeofday, statfs, prints, reads, kill ----

thread_local FakeSystem* fake_system = nullptr;
thread_local const timeval* fake_time = nullptr;
thread_local const struct statfs* fake_space = nullptr;
thread_local const OddPrint* odd_print = nullptr;
thread_local std::optional<size_t> cut_read;
std::atomic<FakeKill*> fake_kill = nullptr;

// ---- steps of files ----

thread_local std::vector<FileStep>* recorded_steps = nullptr;

std::string pathOf(int descriptor) {
  char path[PATH_MAX] = "";
  const std::string link = "/proc/self/fd/" + std::to_string(descriptor);
  const ssize_t length = readlink(link.c_str(), path, sizeof path);
  return std::string(path, length > 0 ? static_cast<size_t>(length) : 0);
}

void record(FileStep step) {
  const int saved = errno;
  recorded_steps->push_back(std::move(step));
  errno = saved;
}

bool isMissing(const char* path) {
  struct stat status;
  return recorded_steps != nullptr && stat(path, &status) != 0;
}

void recordOpen(int descriptor, bool is_new, bool is_cut) {
  if (is_new) record({FileStep::kMade, pathOf(descriptor)});
  if (!is_new && is_cut) record({FileStep::kCut, pathOf(descriptor)});
}

// The bytes that a call has just written in front of the descriptor's position.
void recordWritten(int descriptor, ssize_t count) {
  if (count <= 0) return;
  const int saved = errno;
  const std::string path = pathOf(descriptor);
  const off64_t end = lseek64(descriptor, 0, SEEK_CUR);
  std::string data(static_cast<size_t>(count), '\0');
  const int again = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (again == -1 || pread64(again, data.data(), data.size(), end - count) != count) data.clear();
  if (again != -1) (void)close(again);
  record({FileStep::kWritten, path, end - count, data});
  errno = saved;
}

void recordBuffered(FILE* stream, const void* data, size_t size) {
  const int saved = errno;
  record({FileStep::kBuffered, pathOf(fileno(stream)),
          ftello64(stream) - static_cast<off64_t>(size),
          std::string(static_cast<const char*>(data), size)});
  errno = saved;
}

// ---- PrintMessageCmdLine ----

std::mutex messages_mutex;
std::vector<CatalogueMessage> messages;

}  // namespace

thread_local Passed passed;

FailingCall::FailingCall(Call call, int error, int nth, int times)
    : slot_(takeSlot({true, call, true, error, nth, times, nullptr, 0, false})) {}
FailingCall::~FailingCall() { slots[slot_].used = false; }
bool FailingCall::fired() const { return slots[slot_].fired; }
int FailingCall::calls() const { return slots[slot_].calls; }
void FailingCall::disarm() { slots[slot_].armed = false; }

BeforeCall::BeforeCall(Call call, std::function<void()> during, int nth)
    : slot_(takeSlot(
          {true, call, true, 0, nth, 1, new std::function<void()>(std::move(during)), 0, false})) {}
BeforeCall::~BeforeCall() {
  slots[slot_].used = false;
  delete slots[slot_].during;
}
bool BeforeCall::fired() const { return slots[slot_].fired; }

FakeSleep::FakeSleep() {
  sleep_calls = 0;
  slept_microseconds = 0;
  sleep_is_fake = true;
}
FakeSleep::~FakeSleep() { sleep_is_fake = false; }
int FakeSleep::calls() const { return sleep_calls; }
long long FakeSleep::microseconds() const { return slept_microseconds; }

FakeSystem::FakeSystem(int status) : status_(status) { fake_system = this; }
FakeSystem::~FakeSystem() { fake_system = nullptr; }
int FakeSystem::run(const char* command) {
  commands_.push_back(command != nullptr ? std::optional<std::string>(command) : std::nullopt);
  return status_;
}

FakeClock::FakeClock(long seconds, long microseconds) {
  fake_time = new timeval{seconds, microseconds};
}
FakeClock::~FakeClock() { delete std::exchange(fake_time, nullptr); }

FakeStatfs::FakeStatfs(unsigned long available_blocks, unsigned long free_blocks, long block_size,
                       long fragment_size) {
  struct statfs* const space = new struct statfs();
  space->f_bavail = available_blocks;
  space->f_bfree = free_blocks;
  space->f_bsize = block_size;
  space->f_frsize = fragment_size;
  fake_space = space;
}
FakeStatfs::~FakeStatfs() { delete std::exchange(fake_space, nullptr); }

OddPrint::OddPrint(int answer, Leaves leaves) : answer_(answer), leaves_(leaves) {
  odd_print = this;
}
OddPrint::~OddPrint() { odd_print = nullptr; }

FileSteps::FileSteps() { recorded_steps = &steps_; }
FileSteps::~FileSteps() { recorded_steps = nullptr; }

CutRead::CutRead(size_t bytes) { cut_read = bytes; }
CutRead::~CutRead() { cut_read.reset(); }
bool CutRead::fired() const { return !cut_read; }

FakeKill::FakeKill(int answer) : answer_(answer) { fake_kill = this; }
FakeKill::~FakeKill() { fake_kill = nullptr; }
int FakeKill::run(Signal signal) {
  signals_.push_back(signal);
  return answer_;
}

std::vector<CatalogueMessage> takeCatalogueMessages() {
  const std::lock_guard lock(messages_mutex);
  return std::exchange(messages, {});
}

// ---- files ----

REPLACE(int, stat64, (const char* path, struct stat64* status)) {
  if (const auto error = STRIKE(stat64)) return failed(*error, -1);
  return REAL(stat64)(path, status);
}

REPLACE(int, fstat64, (int descriptor, struct stat64* status)) {
  if (const auto error = STRIKE(fstat64)) return failed(*error, -1);
  return REAL(fstat64)(descriptor, status);
}

REPLACE(int, open64, (const char* path, int flags, ...)) {
  mode_t mode = 0;
  if ((flags & (O_CREAT | O_TMPFILE)) != 0) {
    va_list arguments;
    va_start(arguments, flags);
    mode = va_arg(arguments, mode_t);
    va_end(arguments);
  }
  if (const auto error = STRIKE(open64)) return failed(*error, -1);
  if (recorded_steps == nullptr || !FROM_LIBRARY()) return REAL(open64)(path, flags, mode);
  const bool is_new = isMissing(path);
  const int descriptor = REAL(open64)(path, flags, mode);
  if (descriptor != -1) recordOpen(descriptor, is_new, (flags & O_TRUNC) != 0);
  return descriptor;
}

REPLACE(int, close, (int descriptor)) {
  const auto error = STRIKE(close);
  const int result = REAL(close)(descriptor);  // a close that fails has closed all the same
  return error ? failed(*error, -1) : result;
}

REPLACE(FILE*, fopen64, (const char* path, const char* mode)) {
  if (const auto error = STRIKE(fopen64)) return failed<FILE*>(*error, nullptr);
  if (recorded_steps == nullptr || !FROM_LIBRARY()) return REAL(fopen64)(path, mode);
  const bool is_new = isMissing(path);
  FILE* const stream = REAL(fopen64)(path, mode);
  if (stream != nullptr) recordOpen(fileno(stream), is_new, *mode == 'w');
  return stream;
}

REPLACE(int, fclose, (FILE * stream)) {
  const auto error = STRIKE(fclose);
  if (recorded_steps != nullptr && FROM_LIBRARY()) {
    record({FileStep::kFlushed, pathOf(fileno(stream))});
  }
  const int result = REAL(fclose)(stream);
  return error ? failed(*error, EOF) : result;
}

REPLACE(int, fflush, (FILE * stream)) {
  if (const auto error = STRIKE(fflush)) return failed(*error, EOF);
  const int result = REAL(fflush)(stream);
  if (recorded_steps != nullptr && FROM_LIBRARY()) {
    record({FileStep::kFlushed, pathOf(fileno(stream))});
  }
  return result;
}

namespace {

template <typename Read>
size_t cutRead(Read read, void* buffer, size_t size, size_t count, FILE* stream) {
  const size_t delivered = read(buffer, 1, std::min(size * count, *cut_read), stream);
  cut_read.reset();
  setErrorFlag(stream);
  return failed<size_t>(EIO, delivered / size);
}

}  // namespace

REPLACE(size_t, fread, (void* buffer, size_t size, size_t count, FILE* stream)) {
  if (const auto error = STRIKE(fread)) {
    setErrorFlag(stream);
    return failed<size_t>(*error, 0);
  }
  if (cut_read && FROM_LIBRARY()) return cutRead(REAL(fread), buffer, size, count, stream);
  return REAL(fread)(buffer, size, count, stream);
}

REPLACE(size_t, fread_unlocked, (void* buffer, size_t size, size_t count, FILE* stream)) {
  if (const auto error = STRIKE(fread)) {
    setErrorFlag(stream);
    return failed<size_t>(*error, 0);
  }
  if (cut_read && FROM_LIBRARY()) return cutRead(REAL(fread_unlocked), buffer, size, count, stream);
  return REAL(fread_unlocked)(buffer, size, count, stream);
}

REPLACE(size_t, fwrite, (const void* buffer, size_t size, size_t count, FILE* stream)) {
  if (const auto error = STRIKE(fwrite)) {
    setErrorFlag(stream);
    return failed<size_t>(*error, 0);
  }
  const size_t written = REAL(fwrite)(buffer, size, count, stream);
  if (recorded_steps != nullptr && FROM_LIBRARY()) recordBuffered(stream, buffer, size * written);
  return written;
}

REPLACE(int, fputs, (const char* text, FILE* stream)) {
  if (const auto error = STRIKE(fwrite)) {
    setErrorFlag(stream);
    return failed(*error, EOF);
  }
  return REAL(fputs)(text, stream);
}

REPLACE(int, remove, (const char* path)) {
  if (const auto error = STRIKE(remove)) return failed(*error, -1);
  const int result = REAL(remove)(path);
  if (result == 0 && recorded_steps != nullptr && FROM_LIBRARY()) {
    record({FileStep::kRemoved, path});
  }
  return result;
}

REPLACE(mode_t, umask, (mode_t mask)) {
  (void)STRIKE(umask);
  return REAL(umask)(mask);
}

REPLACE(int, fchown, (int descriptor, uid_t owner, gid_t group)) {
  if (const auto error = STRIKE(fchown)) return failed(*error, -1);
  return REAL(fchown)(descriptor, owner, group);
}

REPLACE(int, chown, (const char* path, uid_t owner, gid_t group)) {
  if (const auto error = STRIKE(chown)) return failed(*error, -1);
  return REAL(chown)(path, owner, group);
}

REPLACE(int, lchown, (const char* path, uid_t owner, gid_t group)) {
  if (const auto error = STRIKE(lchown)) return failed(*error, -1);
  return REAL(lchown)(path, owner, group);
}

REPLACE(int, fchmod, (int descriptor, mode_t mode)) {
  if (const auto error = STRIKE(fchmod)) return failed(*error, -1);
  return REAL(fchmod)(descriptor, mode);
}

REPLACE(int, chmod, (const char* path, mode_t mode)) {
  if (const auto error = STRIKE(chmod)) return failed(*error, -1);
  return REAL(chmod)(path, mode);
}

REPLACE(int, ftruncate64, (int descriptor, off64_t length)) {
  if (const auto error = STRIKE(ftruncate64)) return failed(*error, -1);
  const int result = REAL(ftruncate64)(descriptor, length);
  if (result == 0 && recorded_steps != nullptr && FROM_LIBRARY()) {
    record({FileStep::kCut, pathOf(descriptor), length});
  }
  return result;
}

REPLACE(int, lockf64, (int descriptor, int command, off64_t length)) {
  if (const auto error = STRIKE(lockf64)) return failed(*error, -1);
  return REAL(lockf64)(descriptor, command, length);
}

REPLACE(int, fseeko64, (FILE * stream, off64_t offset, int whence)) {
  if (const auto error = STRIKE(fseeko64)) return failed(*error, -1);
  return REAL(fseeko64)(stream, offset, whence);
}

REPLACE(off64_t, ftello64, (FILE * stream)) {
  if (const auto error = STRIKE(ftello64)) return failed<off64_t>(*error, -1);
  return REAL(ftello64)(stream);
}

REPLACE(ssize_t, copy_file_range,
        (int in, off64_t* in_offset, int out, off64_t* out_offset, size_t length,
         unsigned int flags)) {
  if (const auto error = STRIKE(copy_file_range)) return failed<ssize_t>(*error, -1);
  const ssize_t count = REAL(copy_file_range)(in, in_offset, out, out_offset, length, flags);
  if (recorded_steps != nullptr && FROM_LIBRARY()) recordWritten(out, count);
  return count;
}

REPLACE(ssize_t, sendfile64, (int out, int in, off64_t* offset, size_t length)) {
  if (const auto error = STRIKE(sendfile64)) return failed<ssize_t>(*error, -1);
  const ssize_t count = REAL(sendfile64)(out, in, offset, length);
  if (recorded_steps != nullptr && FROM_LIBRARY()) recordWritten(out, count);
  return count;
}

REPLACE(int, fsync, (int descriptor)) {
  if (const auto error = STRIKE(fsync)) return failed(*error, -1);
  const int result = REAL(fsync)(descriptor);
  if (recorded_steps != nullptr && FROM_LIBRARY()) {
    record({FileStep::kForced, pathOf(descriptor)});
  }
  return result;
}

REPLACE(int, syncfs, (int descriptor)) {
  if (const auto error = STRIKE(syncfs)) return failed(*error, -1);
  const int result = REAL(syncfs)(descriptor);
  if (recorded_steps != nullptr && FROM_LIBRARY()) record({FileStep::kForcedAll, ""});
  return result;
}

REPLACE(ssize_t, read, (int descriptor, void* buffer, size_t length)) {
  if (const auto error = STRIKE(read)) return failed<ssize_t>(*error, -1);
  return REAL(read)(descriptor, buffer, length);
}

REPLACE(ssize_t, write, (int descriptor, const void* buffer, size_t length)) {
  if (const auto error = STRIKE(write)) return failed<ssize_t>(*error, -1);
  const ssize_t count = REAL(write)(descriptor, buffer, length);
  if (recorded_steps != nullptr && FROM_LIBRARY()) recordWritten(descriptor, count);
  return count;
}

REPLACE(int, mkdir, (const char* path, mode_t mode)) {
  if (const auto error = STRIKE(mkdir)) return failed(*error, -1);
  return REAL(mkdir)(path, mode);
}

REPLACE(int, rmdir, (const char* path)) {
  if (const auto error = STRIKE(rmdir)) return failed(*error, -1);
  return REAL(rmdir)(path);
}

REPLACE(int, symlink, (const char* target, const char* link)) {
  if (const auto error = STRIKE(symlink)) return failed(*error, -1);
  return REAL(symlink)(target, link);
}

REPLACE(int, unlink, (const char* path)) {
  if (const auto error = STRIKE(unlink)) return failed(*error, -1);
  return REAL(unlink)(path);
}

REPLACE(int, statfs, (const char* path, struct statfs* space)) {
  if (const auto error = STRIKE(statfs)) return failed(*error, -1);
  if (fake_space != nullptr && FROM_LIBRARY()) {
    *space = *fake_space;
    return 0;
  }
  return REAL(statfs)(path, space);
}

// ---- processes and the clock ----

REPLACE(int, system, (const char* command)) {
  if (const auto error = STRIKE(system)) return failed(*error, -1);
  if (fake_system != nullptr && FROM_LIBRARY()) {
    return fake_system->run(command);
  }
  return REAL(system)(command);
}

REPLACE(int, gettimeofday, (timeval * now, void* zone)) {
  if (const auto error = STRIKE(gettimeofday)) return failed(*error, -1);
  if (fake_time != nullptr && FROM_LIBRARY()) {
    *now = *fake_time;
    return 0;
  }
  return REAL(gettimeofday)(now, zone);
}

REPLACE(int, kill, (pid_t process, int number)) {
  if (FakeKill* const fake = fake_kill) return fake->run({process, number});
  return REAL(kill)(process, number);
}

REPLACE(FILE*, popen, (const char* command, const char* mode)) {
  if (const auto error = STRIKE(popen)) return failed<FILE*>(*error, nullptr);
  return REAL(popen)(command, mode);
}

REPLACE(char*, fgets, (char* buffer, int size, FILE* stream)) {
  if (const auto error = STRIKE(fgets)) {
    setErrorFlag(stream);
    return failed<char*>(*error, nullptr);
  }
  return REAL(fgets)(buffer, size, stream);
}

// ---- the network ----

REPLACE(int, socket, (int domain, int type, int protocol)) {
  if (const auto error = STRIKE(socket)) return failed(*error, -1);
  return REAL(socket)(domain, type, protocol);
}

REPLACE(int, ioctl, (int descriptor, unsigned long request, void* argument)) {
  if (const auto error = STRIKE(ioctl)) return failed(*error, -1);
  return REAL(ioctl)(descriptor, request, argument);
}

REPLACE(int, gethostname, (char* name, size_t size)) {
  if (const auto error = STRIKE(gethostname)) return failed(*error, -1);
  return REAL(gethostname)(name, size);
}

REPLACE(hostent*, gethostbyname, (const char* name)) {
  if (FROM_LIBRARY()) passed.host_name = name;
  if (const auto error = STRIKE(gethostbyname)) return failed<hostent*>(*error, nullptr);
  return REAL(gethostbyname)(name);
}

REPLACE(int, getaddrinfo,
        (const char* node, const char* service, const addrinfo* hints, addrinfo** result)) {
  if (const auto error = STRIKE(getaddrinfo)) return *error;
  return REAL(getaddrinfo)(node, service, hints, result);
}

REPLACE(int, getnameinfo,
        (const sockaddr* address, socklen_t length, char* host, socklen_t host_size, char* service,
         socklen_t service_size, int flags)) {
  if (FROM_LIBRARY()) passed.name_info = {host_size, service, service_size, flags};
  if (const auto error = STRIKE(getnameinfo)) return *error;
  return REAL(getnameinfo)(address, length, host, host_size, service, service_size, flags);
}

REPLACE(int, gethostbyname_r,
        (const char* name, hostent* entry, char* buffer, size_t size, hostent** result,
         int* error_code)) {
  if (FROM_LIBRARY()) passed.work = {entry, buffer - reinterpret_cast<char*>(entry), size};
  if (const auto error = STRIKE(gethostbyname_r)) {
    *result = nullptr;
    *error_code = *error;
    return ERANGE;
  }
  return REAL(gethostbyname_r)(name, entry, buffer, size, result, error_code);
}

REPLACE(int, gethostbyaddr_r,
        (const void* address, socklen_t length, int type, hostent* entry, char* buffer, size_t size,
         hostent** result, int* error_code)) {
  if (FROM_LIBRARY()) passed.work = {entry, buffer - reinterpret_cast<char*>(entry), size};
  if (const auto error = STRIKE(gethostbyaddr_r)) {
    *result = nullptr;
    *error_code = *error;
    return ERANGE;
  }
  return REAL(gethostbyaddr_r)(address, length, type, entry, buffer, size, result, error_code);
}

// ---- accounts ----

REPLACE(void, setpwent, ()) {
  (void)STRIKE(setpwent);
  REAL(setpwent)();
}

REPLACE(void, endpwent, ()) {
  (void)STRIKE(endpwent);
  REAL(endpwent)();
}

REPLACE(passwd*, getpwnam, (const char* name)) {
  if (const auto error = STRIKE(getpwnam)) return failed<passwd*>(*error, nullptr);
  return REAL(getpwnam)(name);
}

REPLACE(passwd*, getpwuid, (uid_t uid)) {
  if (const auto error = STRIKE(getpwuid)) return failed<passwd*>(*error, nullptr);
  return REAL(getpwuid)(uid);
}

REPLACE(group*, getgrnam, (const char* name)) {
  if (const auto error = STRIKE(getgrnam)) return failed<group*>(*error, nullptr);
  return REAL(getgrnam)(name);
}

REPLACE(group*, getgrgid, (gid_t gid)) {
  if (const auto error = STRIKE(getgrgid)) return failed<group*>(*error, nullptr);
  return REAL(getgrgid)(gid);
}

REPLACE(int, getpwuid_r, (uid_t uid, passwd* entry, char* buffer, size_t size, passwd** result)) {
  if (const auto error = STRIKE(getpwuid_r)) {
    *result = nullptr;
    return *error;
  }
  return REAL(getpwuid_r)(uid, entry, buffer, size, result);
}

REPLACE(int, getgrgid_r, (gid_t gid, group* entry, char* buffer, size_t size, group** result)) {
  if (const auto error = STRIKE(getgrgid_r)) {
    *result = nullptr;
    return *error;
  }
  return REAL(getgrgid_r)(gid, entry, buffer, size, result);
}

// ---- threads ----

REPLACE(int, pthread_mutex_lock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_lock)) return *error;
  return REAL(pthread_mutex_lock)(mutex);
}

REPLACE(int, pthread_mutex_trylock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_trylock)) return *error;
  return REAL(pthread_mutex_trylock)(mutex);
}

REPLACE(int, pthread_mutex_unlock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_unlock)) return *error;
  return REAL(pthread_mutex_unlock)(mutex);
}

REPLACE(int, nanosleep, (const timespec* requested, timespec* left)) {
  if (const auto error = STRIKE(nanosleep)) {
    errno = *error;
    return -1;
  }
  if (sleep_is_fake && FROM_LIBRARY()) {
    ++sleep_calls;
    slept_microseconds += requested->tv_sec * 1'000'000 + requested->tv_nsec / 1'000;
    return 0;
  }
  return REAL(nanosleep)(requested, left);
}

// ---- memory ----

#ifdef SANITIZER_OWNS_MALLOC

bool sanitizerOwnsMalloc() { return true; }

namespace {
void* allocated(void* memory, const void*) { return memory; }
}  // namespace

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

// The bookkeeping must not come back here.
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
// Made once and never destroyed: memory is freed after the last destructor, too.
LiveTable& live() {
  alignas(LiveTable) static char place[sizeof(LiveTable)];
  static LiveTable* const table = new (place) LiveTable;
  return *table;
}

void* allocated(void* memory, const void* caller) {
  if (memory != nullptr && watchers > 0 && isLibrary(caller)) {
    const std::lock_guard lock(live_mutex);
    live()[memory] = {pthread_self(), ++allocations};
  }
  return memory;
}

void freed(void* memory) {
  if (memory != nullptr && watchers > 0) {
    const std::lock_guard lock(live_mutex);
    live().erase(memory);
  }
}

}  // namespace

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
  return allocated(__libc_malloc(size), __builtin_return_address(0));
}

REPLACE(void*, calloc, (size_t count, size_t size)) {
  if (const auto error = STRIKE(calloc)) return failed<void*>(*error, nullptr);
  return allocated(__libc_calloc(count, size), __builtin_return_address(0));
}

REPLACE(void*, realloc, (void* memory, size_t size)) {
  if (const auto error = STRIKE(realloc)) return failed<void*>(*error, nullptr);
  freed(memory);
  return allocated(__libc_realloc(memory, size), __builtin_return_address(0));
}

REPLACE(char*, strdup, (const char* text)) {
  if (const auto error = STRIKE(strdup)) return failed<char*>(*error, nullptr);
  const size_t size = strlen(text) + 1;
  void* const copy = allocated(__libc_malloc(size), __builtin_return_address(0));
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
  if (buffer == nullptr) (void)allocated(path, __builtin_return_address(0));
  return path;
}

// ---- the platform's strings, environment and messages ----

EXPORTED int PrintMessageCmdLine(int first, int second, int third, int fourth, int fifth,
                                 const char* text) {
  const std::lock_guard lock(messages_mutex);
  messages.push_back({{first, second, third, fourth, fifth}, text});
  return 0;
}

EXPORTED int vra_vsnprintf(char* buffer, size_t size, const char* format, va_list arguments) {
  if (const auto error = STRIKE(vra_vsnprintf)) return failed(*error, -1);
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  return vsnprintf(buffer, size, format, arguments);
#pragma GCC diagnostic pop
}

EXPORTED int vra_snprintf(char* buffer, size_t size, const char* format, ...) {
  if (FROM_LIBRARY()) passed.print_size = size;
  if (const auto error = STRIKE(vra_snprintf)) return failed(*error, -1);
  va_list arguments;
  va_start(arguments, format);
  const int length = vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  return odd_print != nullptr && FROM_LIBRARY() ? odd_print->answer() : length;
}

EXPORTED int vra_asprintf(char** out, const char* format, ...) {
  if (const auto error = STRIKE(vra_asprintf)) return failed(*error, -1);
  va_list arguments;
  va_start(arguments, format);
  const int length = vasprintf(out, format, arguments);
  va_end(arguments);
  if (length == -1) return -1;
  (void)allocated(*out, __builtin_return_address(0));
  if (odd_print == nullptr || !FROM_LIBRARY()) return length;
  if (odd_print->leaves() == OddPrint::kNull) {
    free(*out);
    *out = nullptr;
  }
  return odd_print->answer();
}

EXPORTED size_t vra_strlcpy(char* destination, const char* source, size_t size) {
  if (const auto error = STRIKE(vra_strlcpy)) return static_cast<size_t>(*error);
  const size_t length = strlen(source);
  if (size != 0) {
    const size_t copied = length < size ? length : size - 1;
    memcpy(destination, source, copied);
    destination[copied] = '\0';
  }
  return length;
}

EXPORTED int default_autolock;
EXPORTED int configfile_read;
EXPORTED int al_configfile_counter;
int default_autolock = 0;
int configfile_read = 1;
int al_configfile_counter = 0;

EXPORTED char* ldap_getenv(const char* name) {
  if (const auto error = STRIKE(ldap_getenv)) return failed<char*>(*error, nullptr);
  const char* const value = getenv(name);
  if (value == nullptr) return nullptr;
  return static_cast<char*>(allocated(strdup(value), __builtin_return_address(0)));
}

EXPORTED int ldap_putenv(char* assignment) {
  if (const auto error = STRIKE(ldap_putenv)) return *error;
  return putenv(assignment);
}
