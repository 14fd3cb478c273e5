#include "trace_directory.h"

#include <errno.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <stdio.h>
#include <sys/mman.h>
#include <sys/random.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "descriptors.h"
#include "metadata.h"

namespace trc {
namespace {

constexpr int kAttempts = 100;

class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() { (void)close(fd_); }  // fails if it is -1
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return fd_; }
  bool isOpen() const { return fd_ != -1; }

 private:
  int fd_;
};

int openRoot(const char* path) {
  return openAboveStandardStreams(AT_FDCWD, path, O_RDONLY | O_DIRECTORY);
}

int openDirectory(int at, const char* name) {
  return openAboveStandardStreams(at, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
}

int makeFile(int directory, const char* name) {
  return openAboveStandardStreams(directory, name, O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW, 0600);
}

bool writeAll(int fd, const char* data, size_t size) {
  while (size != 0) {
    const ssize_t written = write(fd, data, size);
    if (written <= 0) return false;
    data += written;
    size -= static_cast<size_t>(written);
  }
  return true;
}

// Exceeding RLIMIT_FSIZE raises SIGXFSZ, which would end the program.
bool isFileSizeAllowed(uint64_t bytes) {
  rlimit limit;
  return getrlimit(RLIMIT_FSIZE, &limit) == 0 && bytes <= limit.rlim_cur;
}

bool writeMetadataFile(int directory, const Uuid& uuid, bool are_packets_numbered) {
  // Static: the stack may be small, and a signal handler may have interrupted malloc().
  static char text[64 * 1024];
  const size_t length = writeMetadata(text, sizeof text, uuid, are_packets_numbered);
  if (length == 0 || !isFileSizeAllowed(length)) return false;

  const Descriptor file(makeFile(directory, ".metadata"));
  if (!file.isOpen()) return false;
  if (!writeAll(file.get(), text, length) ||
      renameat(directory, ".metadata", directory, "metadata") != 0) {
    (void)unlinkat(directory, ".metadata", 0);
    return false;
  }
  return true;
}

// Fills the new directory `hidden` and gives it its name.
bool completeTrace(int root, const char* hidden, bool are_packets_numbered, TraceDirectory& out) {
  const Descriptor directory(openDirectory(root, hidden));
  struct stat status;
  if (!directory.isOpen() || fstat(directory.get(), &status) != 0) return false;
  out.device = status.st_dev;
  out.inode = status.st_ino;
  if (!writeMetadataFile(directory.get(), out.uuid, are_packets_numbered)) return false;
  if (canMakeFirstFile(directory.get()) && renameat(root, hidden, root, out.name) == 0) return true;
  (void)unlinkat(directory.get(), "metadata", 0);
  return false;
}

}  // namespace

// Writing zeros is faster than fallocate() here: the pages are in memory when the file is mapped.
int makeZeroFile(int directory, const char* name, uint64_t bytes) {
  static char zeros[64 * 1024];
  if (!isFileSizeAllowed(bytes)) return -1;
  const int fd = makeFile(directory, name);
  if (fd == -1) return -1;
  while (bytes != 0) {
    const size_t piece = std::min<uint64_t>(sizeof zeros, bytes);
    if (!writeAll(fd, zeros, piece)) {
      (void)close(fd);
      (void)unlinkat(directory, name, 0);
      return -1;
    }
    bytes -= piece;
  }
  return fd;
}

char* makeMappedFile(int directory, const char* name, uint64_t bytes) {
  const int fd = makeZeroFile(directory, name, bytes);
  if (fd == -1) return nullptr;
  void* base = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  // Pages of tmpfs that are mapped for reading can be written too, and the kernel maps many of them at a time.
  struct statfs file_system;
  const bool is_tmpfs = fstatfs(fd, &file_system) == 0 && file_system.f_type == TMPFS_MAGIC;
  (void)close(fd);
  // Faster than one page fault for each page. Before Linux 5.14 it fails with EINVAL.
  if (base != MAP_FAILED &&
      madvise(base, bytes, is_tmpfs ? MADV_POPULATE_READ : MADV_POPULATE_WRITE) != 0 &&
      errno != EINVAL) {
    (void)munmap(base, bytes);
    base = MAP_FAILED;
  }
  if (base != MAP_FAILED) return static_cast<char*>(base);
  (void)unlinkat(directory, name, 0);
  return nullptr;
}

bool setFileSize(int directory, const char* name, uint64_t bytes) {
  if (!isFileSizeAllowed(bytes)) return false;
  const Descriptor file(openAboveStandardStreams(directory, name, O_RDWR | O_NOFOLLOW));
  return file.isOpen() && ftruncate(file.get(), static_cast<off_t>(bytes)) == 0;
}

bool canMakeFirstFile(int directory) {
  (void)unlinkat(directory, ".room", 0);  // there if it could not be removed before
  const Descriptor file(makeZeroFile(directory, ".room", kFirstFileBytes));
  return file.isOpen() && unlinkat(directory, ".room", 0) == 0;
}

bool makeTraceDirectory(const char* root_path, bool are_packets_numbered, TraceDirectory& out) {
  if (mkdir(root_path, 0700) != 0 && errno != EEXIST) return false;
  const Descriptor root(openRoot(root_path));
  if (!root.isOpen()) return false;
  if (getrandom(out.uuid.data(), sizeof out.uuid, 0) != sizeof out.uuid) return false;

  char program[64];
  programName(program, sizeof program);
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    timespec now;
    (void)clock_gettime(CLOCK_REALTIME, &now);
    (void)snprintf(out.name, sizeof out.name, "%s-%d-%lx%08lx", program, static_cast<int>(getpid()),
                   static_cast<unsigned long>(now.tv_sec), static_cast<unsigned long>(now.tv_nsec));
    char hidden[sizeof out.name + 1];
    (void)snprintf(hidden, sizeof hidden, ".%s", out.name);
    if (mkdirat(root.get(), hidden, 0700) != 0) {
      if (errno == EEXIST) continue;
      return false;
    }
    if (completeTrace(root.get(), hidden, are_packets_numbered, out)) return true;
    (void)unlinkat(root.get(), hidden, AT_REMOVEDIR);
    return false;
  }
  return false;
}

int openTraceDirectory(const char* root_path, const TraceDirectory& directory) {
  const Descriptor root(openRoot(root_path));
  if (!root.isOpen()) return -1;
  const int fd = openDirectory(root.get(), directory.name);
  struct stat status;  // fstat() and close() fail if there is no descriptor
  if (fstat(fd, &status) == 0 && status.st_dev == directory.device &&
      status.st_ino == directory.inode) {
    return fd;
  }
  (void)close(fd);
  return -1;
}

}  // namespace trc
