// Preloaded into the osutils tool by its tests: makes a call fail in the middle of an edit, after all
// checks. OSUTILS_TEST_FAULT names the fault.
#include <dlfcn.h>
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <string_view>

#define EXPORTED extern "C" __attribute__((visibility("default")))

namespace {

bool isFault(std::string_view name) {
  const char* const fault = getenv("OSUTILS_TEST_FAULT");
  return fault != nullptr && name == fault;
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

}  // namespace

EXPORTED FILE* fopen64(const char* path, const char* mode) {
  static bool is_edited = false;
  if (isFault("unreadable afterwards") && !isBackup(path)) {
    if (is_edited && *mode == 'r') {
      errno = EMFILE;
      return nullptr;
    }
    is_edited = *mode != 'r';
  }
  if (isFault("unopenable backup") && isBackup(path) && *mode == 'r') {
    errno = ENFILE;
    return nullptr;
  }
  if (isFault("short copy") && isBackup(path) && *mode == 'w') limitFiles(30);
  if (isFault("short rewrite") && !isBackup(path) && *mode == 'w') limitFiles(30);
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

EXPORTED int fsync(int descriptor) {
  // Only for the edited file, not for its copy or a folder.
  struct stat status = {};
  char path[1024] = "";
  const std::string link = "/proc/self/fd/" + std::to_string(descriptor);
  if (isFault("unforced file") && fstat(descriptor, &status) == 0 && S_ISREG(status.st_mode) &&
      readlink(link.c_str(), path, sizeof path - 1) > 0 && !isBackup(path)) {
    errno = EIO;
    return -1;
  }
  return real<decltype(fsync)>("fsync")(descriptor);
}

// The library calls remove, the tool unlink.
EXPORTED int remove(const char* path) noexcept {
  if (isFault("stuck backup") && isBackup(path)) {
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
