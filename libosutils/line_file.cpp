#include "line_file.h"

#include <algorithm>

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
    // Not from the first character on: it was just written, and a load of several bytes with it would
    // wait for that.
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
  const size_t got = fread_unlocked(block_ + end_, 1, room, stream_);
  end_ += got;
  at_end_ = got < room;
  first_ = block_[0];
}

namespace {

bool getStatus(const char* path, struct stat64& status) {
  return path != nullptr && stat64(path, &status) == 0;
}

}  // namespace

bool copyToBackup(const char* path, const char* backup) {
  struct stat64 original;
  struct stat64 copy;
  if (!getStatus(path, original)) return false;
  if (getStatus(backup, copy) && copy.st_dev == original.st_dev && copy.st_ino == original.st_ino) {
    return false;
  }
  return copyFile(path, const_cast<char*>(backup), nullptr, nullptr, 0640) &&
         getStatus(backup, copy) && copy.st_size >= original.st_size;
}

}  // namespace osutils
