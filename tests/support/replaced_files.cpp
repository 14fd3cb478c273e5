// The replaced functions for files and directories.

#include <fcntl.h>
#include <limits.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "replaced.h"

using faults::failed;
using faults::setErrorFlag;

namespace {

thread_local const struct statfs* fake_space = nullptr;
thread_local std::optional<size_t> cut_read;

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

// Records the bytes before the descriptor's position, which a call has just written.
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

}  // namespace

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

FileSteps::FileSteps() { recorded_steps = &steps_; }
FileSteps::~FileSteps() { recorded_steps = nullptr; }

CutRead::CutRead(size_t bytes) { cut_read = bytes; }
CutRead::~CutRead() { cut_read.reset(); }
bool CutRead::fired() const { return !cut_read; }

REPLACE(int, stat64, (const char* path, struct stat64* status)) {
  if (const auto error = STRIKE(stat64)) return failed(*error, -1);
  return REAL(stat64)(path, status);
}

REPLACE(int, lstat64, (const char* path, struct stat64* status)) {
  if (const auto error = STRIKE(lstat64)) return failed(*error, -1);
  return REAL(lstat64)(path, status);
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

REPLACE(int, getc, (FILE * stream)) {
  if (const auto error = STRIKE(getc)) {
    setErrorFlag(stream);
    return failed(*error, EOF);
  }
  return REAL(getc)(stream);
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
  if (const auto error = stream == stderr ? STRIKE(message) : STRIKE(fwrite)) {
    setErrorFlag(stream);
    return failed<size_t>(*error, 0);
  }
  const size_t written = REAL(fwrite)(buffer, size, count, stream);
  if (recorded_steps != nullptr && FROM_LIBRARY()) recordBuffered(stream, buffer, size * written);
  return written;
}

REPLACE(int, fputs, (const char* text, FILE* stream)) {
  if (const auto error = stream == stderr ? STRIKE(message) : STRIKE(fwrite)) {
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
