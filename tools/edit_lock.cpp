#include "edit_lock.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>

#include "command.h"

namespace {

constexpr std::chrono::seconds kTimeout(15);
constexpr std::chrono::milliseconds kPollInterval(20);
constexpr size_t kMaxCommandLength = 500;

using Clock = std::chrono::steady_clock;

struct flock wholeFile() {
  struct flock lock = {};
  lock.l_type = F_WRLCK;
  lock.l_whence = SEEK_SET;
  return lock;
}

// "PID COMMAND", the command as it was typed, as far as the system tells.
std::string holderRecord() {
  std::string command;
  const int descriptor = ::open("/proc/self/cmdline", O_RDONLY | O_CLOEXEC);
  if (descriptor != -1) {
    char text[kMaxCommandLength];
    const ssize_t size = read(descriptor, text, sizeof text);
    if (size > 0) command.assign(text, static_cast<size_t>(size));
    (void)close(descriptor);
  }
  while (command.ends_with('\0')) command.pop_back();
  std::replace(command.begin(), command.end(), '\0', ' ');
  return std::to_string(getpid()) + " " + printable(command);
}

Failure lockFailure(const char* what, const std::string& path) {
  const int error = errno;
  return Failure(
      error == EACCES || error == EPERM ? OSUTILS_INSUFFICIENT_ACCESS : OSUTILS_OPERATIONS_ERROR,
      std::string("cannot ") + what + " the lock " + path + ": " + strerror(error));
}

}  // namespace

EditLock::EditLock(const std::string& file) {
  struct stat status = {};
  (void)stat(file.c_str(), &status);
  // The same lock under each of the links that lead to the file.
  std::error_code unknown;
  const std::filesystem::path target = std::filesystem::weakly_canonical(file, unknown);
  path_ = (unknown ? file : target.string()) + ".lock";

  const Clock::time_point end = Clock::now() + kTimeout;
  bool announced = false;
  try {
    for (;;) {
      if (descriptor_ == -1) open(status);
      if (tryLock()) {
        if (isStillInPlace()) break;
        (void)close(descriptor_);  // somebody removed it: others lock the file that is there now
        descriptor_ = -1;
        continue;
      }
      if (!announced) {
        announced = true;
        printNotice("waiting up to " + std::to_string(kTimeout.count()) + " s for " + path_ + ": " +
                    holder() + " holds it");
      }
      if (Clock::now() >= end) {
        throw Failure(OSUTILS_UNAVAILABLE, holder() + " still holds the lock " + path_);
      }
      std::this_thread::sleep_for(kPollInterval);
    }
  } catch (...) {
    if (descriptor_ != -1) (void)close(descriptor_);
    throw;
  }
  writeHolder();
}

EditLock::~EditLock() { (void)close(descriptor_); }

bool EditLock::isLockFile(const struct stat& status) const {
  struct stat own;
  return fstat(descriptor_, &own) == 0 && own.st_dev == status.st_dev &&
         own.st_ino == status.st_ino;
}

// Opens the lock's file, or makes it. Never both in one call: in a folder like /tmp the system refuses
// O_CREAT for a file that is there and somebody else's.
void EditLock::open(const struct stat& file) {
  constexpr int kFlags = O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
  do {
    descriptor_ = ::open(path_.c_str(), kFlags);
    if (descriptor_ != -1 || errno != ENOENT) break;
    descriptor_ = ::open(path_.c_str(), kFlags | O_CREAT | O_EXCL, 0600);
    if (descriptor_ != -1) {
      (void)fchmod(descriptor_, 0600);
      // Made by root for somebody else's file, it would keep its owner out for good.
      if (geteuid() == 0) (void)!fchown(descriptor_, file.st_uid, file.st_gid);
    }
  } while (descriptor_ == -1 && errno == EEXIST);
  if (descriptor_ == -1) {
    if (errno == ELOOP) {
      throw Failure(OSUTILS_UNWILLING_TO_PERFORM, "the lock " + path_ + " is a symbolic link");
    }
    throw lockFailure("open", path_);
  }
  struct stat own;
  if (fstat(descriptor_, &own) != 0) throw lockFailure("examine", path_);
  if (!S_ISREG(own.st_mode)) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM, "the lock " + path_ + " is not a regular file");
  }
  // The lock is written to: it must not be another name of somebody's file.
  if (own.st_nlink > 1) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM, "the lock " + path_ + " has several hard links");
  }
}

bool EditLock::tryLock() {
  struct flock lock = wholeFile();
  if (fcntl(descriptor_, F_SETLK, &lock) == 0) return true;
  if (errno != EACCES && errno != EAGAIN) throw lockFailure("take", path_);
  return false;
}

bool EditLock::isStillInPlace() const {
  struct stat status;
  return lstat(path_.c_str(), &status) == 0 && isLockFile(status);
}

// What is written here is for people only: on a full disk the lock holds without it.
void EditLock::writeHolder() const {
  const std::string text = holderRecord() + "\n";
  if (ftruncate(descriptor_, 0) == 0) (void)!pwrite(descriptor_, text.data(), text.size(), 0);
}

// The system knows the process, unless it ended meanwhile or is one of another container; the file knows
// the command.
std::string EditLock::holder() const {
  char text[kMaxCommandLength + 32];
  const ssize_t size = pread(descriptor_, text, sizeof text, 0);
  std::string recorded(text, size > 0 ? static_cast<size_t>(size) : 0);
  recorded.resize(std::min(recorded.find('\n'), recorded.size()));
  const size_t blank = std::min(recorded.find(' '), recorded.size());

  struct flock lock = wholeFile();
  if (fcntl(descriptor_, F_GETLK, &lock) == 0 && lock.l_type != F_UNLCK && lock.l_pid > 0) {
    const std::string process = std::to_string(lock.l_pid);
    if (recorded.substr(0, blank) != process) return "process " + process;
  }
  if (recorded.empty()) return "another process";
  return "process " + recorded.substr(0, blank) + " (" +
         recorded.substr(std::min(blank + 1, recorded.size())) + ")";
}
