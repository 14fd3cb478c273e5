// Preloaded into the osutils tool by its tests: makes calls fail in the middle of an edit, after all
// checks. OSUTILS_TEST_FAULT names the faults, with commas between them.
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <signal.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <new>
#include <string>
#include <string_view>
#include <typeinfo>

#define EXPORTED extern "C" __attribute__((visibility("default")))

namespace {

bool isFault(const std::string& name) {
  const char* const faults = getenv("OSUTILS_TEST_FAULT");
  if (faults == nullptr) return false;
  return ("," + std::string(faults) + ",").find("," + name + ",") != std::string::npos;
}

bool failWith(int error) {
  errno = error;
  return true;
}

bool isBackup(const char* path) { return std::string_view(path).ends_with(".vrasave"); }

// Makes writes beyond this size fail, as on a full disk.
void limitFiles(rlim_t bytes) {
  rlimit limit = {};
  getrlimit(RLIMIT_FSIZE, &limit);
  limit.rlim_cur = bytes;
  setrlimit(RLIMIT_FSIZE, &limit);
}

template <typename Function>
Function* real(const char* name) {
  return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

bool has_written;   // the editor has opened the file to write it
bool is_edit_over;  // the editor has removed the backup

// Allocates nothing.
bool isFaultOfMemory(const char* name) {
  const char* const faults = getenv("OSUTILS_TEST_FAULT");
  return faults != nullptr && strstr(faults, name) != nullptr;
}

// The path of an open file.
std::string pathOf(int descriptor) {
  char path[1024] = "";
  const std::string link = "/proc/self/fd/" + std::to_string(descriptor);
  const ssize_t length = readlink(link.c_str(), path, sizeof path);
  return {path, length < 0 ? 0 : static_cast<size_t>(length)};
}

// The entry of an account, or an error of the look-up: "lookup 5" is EIO.
template <typename Look>
auto lookedUp(const Look& look) -> decltype(look()) {
  for (int error = 1; error < 40; ++error) {
    if (isFault("lookup " + std::to_string(error))) {
      errno = error;
      return nullptr;
    }
  }
  static int lookups = 0;
  ++lookups;
  if (lookups == 1 && isFault("first lookup")) return nullptr;
  return look();
}

}  // namespace

EXPORTED passwd* getpwnam(const char* name) {
  return lookedUp([name] { return real<decltype(getpwnam)>("getpwnam")(name); });
}

EXPORTED group* getgrnam(const char* name) {
  static int lookups = 0;
  ++lookups;
  if (lookups == 2 && isFault("second group lookup")) return nullptr;
  if (lookups > 1 && isFault("later group lookups")) return nullptr;
  return lookedUp([name] { return real<decltype(getgrnam)>("getgrnam")(name); });
}

EXPORTED int open(const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  const bool reads = (flags & (O_ACCMODE | O_DIRECTORY)) == O_RDONLY;
  const bool is_lock = std::string_view(path).ends_with(".lock");
  if (is_lock && isFault("forbidden lock") && failWith(EPERM)) return -1;
  if (has_written && reads && isFault(isBackup(path) ? "hidden copy" : "hidden file")) {
    errno = EIO;
    return -1;
  }
  return real<int(const char*, int, ...)>("open")(path, flags, mode);
}

// With _FORTIFY_SOURCE.
EXPORTED int __open_2(const char* path, int flags) { return open(path, flags); }

EXPORTED int fcntl(int descriptor, int command, ...) {
  va_list arguments;
  va_start(arguments, command);
  void* const argument = va_arg(arguments, void*);
  va_end(arguments);
  if (command == F_SETLK && isFault("no locks") && failWith(ENOLCK)) return -1;
  return real<int(int, int, ...)>("fcntl")(descriptor, command, argument);
}

EXPORTED ssize_t pwrite(int descriptor, const void* text, size_t size, off_t offset) {
  if (isFault("full disk") && failWith(ENOSPC)) return -1;
  if (isFault("small writes")) size = size < 7 ? size : 7;
  return real<decltype(pwrite)>("pwrite")(descriptor, text, size, offset);
}

EXPORTED int ftruncate(int descriptor, off_t size) noexcept {
  if (has_written && isFault("stuck size") && failWith(EPERM)) return -1;
  return real<int(int, off_t)>("ftruncate")(descriptor, size);
}

EXPORTED FILE* fopen64(const char* path, const char* mode) {
  if (has_written && *mode == 'r' && !isBackup(path)) {
    if (isFault("unreadable afterwards") && failWith(EMFILE)) return nullptr;
    if (isFault("line again")) {
      FILE* const other = real<decltype(fopen64)>("fopen64")(path, "a");
      fputs(getenv("OSUTILS_TEST_LINE"), other);
      fclose(other);
    }
  }
  if (*mode != 'r' && !isBackup(path)) has_written = true;
  if (isFault("unopenable backup") && isBackup(path) && *mode == 'r') {
    errno = ENFILE;
    return nullptr;
  }
  if (isFault("short copy") && isBackup(path) && *mode == 'w') limitFiles(30);
  if (isFault("short rewrite") && !isBackup(path) && *mode == 'w') limitFiles(30);
  if (isFault("lost copy") && !isBackup(path) && *mode == 'w') {
    real<int(const char*)>("unlink")((std::string(path) + ".vrasave").c_str());
  }
  if (isFault("short line") && *mode == 'a') {
    struct stat status = {};
    stat(path, &status);
    limitFiles(static_cast<rlim_t>(status.st_size) + 5);
  }
  if (isFault("foreign line") && *mode == 'a') {
    FILE* const other = real<decltype(fopen64)>("fopen64")(path, "a");
    fputs("foreign 4999/tcp\n", other);
    fclose(other);
  }
  return real<decltype(fopen64)>("fopen64")(path, mode);
}

// The tool reads with it.
EXPORTED FILE* fopen(const char* path, const char* mode) {
  if (isFault("other first name")) {
    FILE* const other = real<decltype(fopen64)>("fopen64")(path, "r+");
    fputs("other", other);
    fclose(other);
  }
  return real<decltype(fopen)>("fopen")(path, mode);
}

EXPORTED int system(const char* command) {
  if (isFault("no processes") && failWith(EAGAIN)) return -1;
  return real<decltype(system)>("system")(command);
}

// The editors read with it.
EXPORTED size_t fread_unlocked(void* buffer, size_t size, size_t count, FILE* stream) {
  if (isFault("unread lines") && failWith(EIO)) return 0;
  return real<decltype(fread_unlocked)>("fread_unlocked")(buffer, size, count, stream);
}

EXPORTED int fsync(int descriptor) {
  struct stat status = {};
  const bool is_known = fstat(descriptor, &status) == 0;
  const std::string path = pathOf(descriptor);
  const char* const kind = is_known && S_ISDIR(status.st_mode) ? "folder"
                           : isBackup(path.c_str())            ? "backup"
                                                               : "file";
  if (isFault(std::string("unforced ") + kind) && failWith(EIO)) return -1;
  if (isFault("no fsync") && failWith(EINVAL)) return -1;
  if (isFault("fsync of what cannot be written") && failWith(EROFS)) return -1;
  return real<decltype(fsync)>("fsync")(descriptor);
}

// The library calls remove, the tool unlink.
EXPORTED int remove(const char* path) noexcept {
  const bool is_stuck = isFault("stuck backup");
  is_edit_over = isBackup(path);
  if (is_stuck && is_edit_over) {
    errno = EBUSY;
    return -1;
  }
  return real<int(const char*)>("remove")(path);
}

EXPORTED int unlink(const char* path) noexcept {
  if (isFault("stuck backup") && isBackup(path)) {
    errno = EBUSY;
    return -1;
  }
  return real<int(const char*)>("unlink")(path);
}

void* operator new(size_t size) {
  if (is_edit_over && isFaultOfMemory("no memory afterwards")) throw std::bad_alloc();
  if (is_edit_over && isFaultOfMemory("other exception afterwards")) throw std::bad_cast();
  return real<void*(size_t)>("_Znwm")(size);
}
