#include "line_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>

#include "descriptors.h"

namespace osutils {

bool LineReader::next() {
  line_ = next_;
  while (!findEnd()) readOn();
  block_[line_] = first_;
  first_ = block_[next_];
  block_[next_] = '\0';
  return next_ > line_;
}

bool LineReader::findEnd() {
  const size_t length = std::min(end_ - line_, kLongestLine);
  if (length > 0) {
    // Not from the first character: it was just written, and a wide load that includes it would
    // wait for the store.
    const void* const newline =
        first_ == '\n' ? block_ + line_ : memchr(block_ + line_ + 1, '\n', length - 1);
    if (newline != nullptr) {
      next_ = static_cast<size_t>(static_cast<const char*>(newline) - block_) + 1;
      return true;
    }
  }
  next_ = line_ + length;
  return length == kLongestLine || at_end_;
}

void LineReader::readOn() {
  block_[line_] = first_;
  end_ -= line_;
  memmove(block_, block_ + line_, end_);
  line_ = 0;
  const size_t room = kBlockBytes - end_;
  const size_t got = readStream(stream_, block_ + end_, room);
  end_ += got;
  at_end_ = got < room;
  first_ = block_[0];
}

namespace {

bool getStatus(const char* path, struct stat64& status) {
  return path != nullptr && stat64(path, &status) == 0;
}

// Calls fsync or syncfs. On a file system that has nothing to force, errno is EINVAL.
bool force(int (*function)(int), int descriptor) {
  int rc = 0;
  do {
    rc = function(descriptor);
  } while (rc != 0 && errno == EINTR);
  return rc == 0 || errno == EINVAL;
}

// Opens the folder that contains the file's name. Returns -1 for a link, whose name is not the
// file's, for a folder that cannot be read, and for a path that is too long for a small stack.
int openFolderOf(const char* path) {
  struct stat64 status;
  if (lstat64(path, &status) != 0 || S_ISLNK(status.st_mode)) return -1;
  const char* const slash = strrchr(path, '/');
  if (slash == nullptr) return open64(".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  char folder[1024];
  const size_t length =
      static_cast<size_t>(slash - path) + 1;  // with the "/", which may be the whole folder
  if (length >= sizeof folder) return -1;
  memcpy(folder, path, length);
  folder[length] = '\0';
  return open64(folder, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
}

// Forces the file and its name to the disk. Opens it for writing, as the copy did, because it may
// be unreadable.
bool forceFileToDisk(const char* path) {
  const StandardStreamPlaceholders placeholders;
  const int file = open64(path, O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (file == -1) return false;
  bool forced = force(fsync, file);
  if (forced) {
    const int folder = openFolderOf(path);
    // If the folder cannot be opened, forces the whole file system, which includes it.
    forced = folder != -1 ? force(fsync, folder) : force(syncfs, file);
    if (folder != -1) (void)close(folder);
  }
  (void)close(file);
  return forced;
}

}  // namespace

bool copyToBackup(const char* path, const char* backup) {
  struct stat64 original;
  struct stat64 copy;
  if (!getStatus(path, original)) return false;
  if (getStatus(backup, copy) && copy.st_dev == original.st_dev && copy.st_ino == original.st_ino) {
    return false;
  }
  char* const backup_name = const_cast<char*>(backup);  // it is only read
  if (!copyFile(path, backup_name, nullptr, nullptr, 0640) || !getStatus(backup, copy) ||
      copy.st_size < original.st_size) {
    return false;
  }
  if (!forceFileToDisk(backup)) {
    (void)deleteFile(backup_name);
    return false;
  }
  return true;
}

bool closeOnDisk(OwnedStream stream) {
  const bool forced = fflush(stream.get()) == 0 && force(fsync, fileno_unlocked(stream.get()));
  return fclose(stream.release()) == 0 && forced;
}

}  // namespace osutils
