// The lock that a command takes before it edits a file.
#pragma once

#include <sys/stat.h>

#include <string>

// A write lock (fcntl) on FILE.lock, held until the end of the scope. The lock's file has mode 0600
// and names its last holder. It is never removed: another process may be waiting for it.
class EditLock {
 public:
  // Waits at most 15 seconds. If it waits, prints a line on standard error that names the holder.
  explicit EditLock(const std::string& file);
  ~EditLock();
  EditLock(const EditLock&) = delete;
  EditLock& operator=(const EditLock&) = delete;

  // True if the status is that of the lock's file. The process must not open this file again:
  // closing any descriptor of it releases the lock.
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
