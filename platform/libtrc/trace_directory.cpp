#include "trace_directory.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/random.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "metadata.h"

namespace trc {
namespace {

constexpr int kAttempts = 100;

class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() {
    if (fd_ >= 0) (void)close(fd_);
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return fd_; }
  bool isOpen() const { return fd_ >= 0; }

 private:
  int fd_;
};

int openDirectory(int at, const char* name) {
  return openat(at, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
}

bool writeAll(int fd, const char* data, size_t size) {
  while (size > 0) {
    const ssize_t written = write(fd, data, size);
    if (written < 0) return false;
    data += written;
    size -= static_cast<size_t>(written);
  }
  return true;
}

bool writeMetadataFile(int directory, const uint8_t (&uuid)[16]) {
  // Not on the stack, which may be a small one, nor on the heap, which the thread may just be working on.
  static char text[64 * 1024];
  const size_t length = writeMetadata(text, sizeof text, uuid);
  if (length == 0 || !isFileSizeAllowed(length)) return false;

  const Descriptor file(
      openat(directory, ".metadata", O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!file.isOpen()) return false;
  if (!writeAll(file.get(), text, length) ||
      renameat(directory, ".metadata", directory, "metadata") != 0) {
    (void)unlinkat(directory, ".metadata", 0);
    return false;
  }
  return true;
}

// Fills the new directory `hidden` and gives it its name.
bool completeTrace(int root, const char* hidden, TraceDirectory& out) {
  const Descriptor directory(openDirectory(root, hidden));
  struct stat status;
  if (!directory.isOpen() || fstat(directory.get(), &status) != 0) return false;
  out.device = status.st_dev;
  out.inode = status.st_ino;
  if (!writeMetadataFile(directory.get(), out.uuid)) return false;
  if (renameat(root, hidden, root, out.name) == 0) return true;
  (void)unlinkat(directory.get(), "metadata", 0);
  return false;
}

}  // namespace

bool isFileSizeAllowed(uint64_t bytes) {
  rlimit limit;
  return getrlimit(RLIMIT_FSIZE, &limit) == 0 && bytes <= limit.rlim_cur;
}

bool makeRoot(const char* root) {
  if (mkdir(root, 0700) != 0 && errno != EEXIST) return false;
  const Descriptor directory(open(root, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return directory.isOpen() && faccessat(AT_FDCWD, root, W_OK | X_OK, AT_EACCESS) == 0;
}

bool makeTraceDirectory(const char* root_path, TraceDirectory& out) {
  if (!makeRoot(root_path)) return false;
  const Descriptor root(open(root_path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!root.isOpen()) return false;
  if (getrandom(out.uuid, sizeof out.uuid, 0) != sizeof out.uuid) return false;

  char program[64];
  programName(program, sizeof program);
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    timespec now;
    (void)clock_gettime(CLOCK_REALTIME, &now);
    char hidden[sizeof out.name + 1] = "";
    (void)snprintf(hidden, sizeof hidden, ".%s-%d-%lx%08lx", program, static_cast<int>(getpid()),
                   static_cast<unsigned long>(now.tv_sec), static_cast<unsigned long>(now.tv_nsec));
    if (mkdirat(root.get(), hidden, 0700) != 0) {
      if (errno == EEXIST) continue;
      return false;
    }
    memcpy(out.name, hidden + 1, sizeof out.name);  // without the dot
    if (completeTrace(root.get(), hidden, out)) return true;
    (void)unlinkat(root.get(), hidden, AT_REMOVEDIR);
    return false;
  }
  return false;
}

int openTraceDirectory(const char* root_path, const TraceDirectory& directory) {
  const Descriptor root(open(root_path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!root.isOpen()) return -1;
  const int fd = openDirectory(root.get(), directory.name);
  if (fd < 0) return -1;
  struct stat status;
  if (fstat(fd, &status) == 0 && status.st_dev == directory.device &&
      status.st_ino == directory.inode) {
    return fd;
  }
  (void)close(fd);
  return -1;
}

}  // namespace trc
