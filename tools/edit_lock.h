// The lock that a command takes before it edits a file.
#pragma once

#include <sys/stat.h>

#include <string>

// A write lock (fcntl) on FILE.lock, held until the end of the scope. The lock's file has mode 0600, says
// which process holds it or held it last, and is never removed: somebody may be waiting for it.
class EditLock {
 public:
  // Waits for 15 seconds at most, with one line on standard error that names the holder.
  explicit EditLock(const std::string& file);
  ~EditLock();
  EditLock(const EditLock&) = delete;
  EditLock& operator=(const EditLock&) = delete;

  // True when the status is that of the lock's file. The process must not open that again: closing any
  // of its descriptors would release the lock.
  bool isLockFile(const struct stat& status) const;

 private:
  void open(const struct stat& file);
  bool tryLock();
  bool isStillInPlace() const;
  void writeHolder() const;
  std::string holder() const;

  std::string path_;
  int descriptor_ = -1;
};
