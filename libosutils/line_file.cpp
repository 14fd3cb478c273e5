#include "line_file.h"

#include <algorithm>

namespace osutils {

bool LineReader::next() {
  length_ = 0;
  bool complete = false;
  while (!complete && length_ < sizeof line_ - 1) {
    if (begin_ == end_) {
      if (at_end_) break;
      begin_ = 0;
      end_ = fread_unlocked(block_, 1, sizeof block_, stream_);
      at_end_ = end_ < sizeof block_;
      if (end_ == 0) break;
    }
    const char* const rest = block_ + begin_;
    size_t taken = std::min(end_ - begin_, sizeof line_ - 1 - length_);
    const void* const newline = memchr(rest, '\n', taken);
    if (newline != nullptr) {
      taken = static_cast<size_t>(static_cast<const char*>(newline) - rest) + 1;
      complete = true;
    }
    memcpy(line_ + length_, rest, taken);
    length_ += taken;
    begin_ += taken;
  }
  line_[length_] = '\0';
  return length_ > 0;
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
