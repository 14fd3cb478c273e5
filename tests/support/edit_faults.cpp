// Preloaded into the osutils tool by its tests: something goes wrong in the middle of an edit, where no
// check beforehand can know it. OSUTILS_TEST_FAULT says what.
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

// As if the disk were full when the file has so many bytes.
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
  // Only of the file itself, neither its copy nor a folder.
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

// The library's and the tool's own way to remove a file.
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
