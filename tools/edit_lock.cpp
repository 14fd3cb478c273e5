#include "edit_lock.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <string_view>
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

// "PID COMMAND". The command is empty if /proc is unavailable.
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
  // All links to the file use the same lock.
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
        (void)close(descriptor_);  // it was removed: others lock its successor
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

// Opens or creates the lock's file, in separate calls: in a sticky directory like /tmp, the system
// may refuse O_CREAT for another user's existing file (fs.protected_regular).
void EditLock::open(const struct stat& file) {
  constexpr int kFlags = O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
  do {
    descriptor_ = ::open(path_.c_str(), kFlags);
    if (descriptor_ != -1 || errno != ENOENT) break;
    descriptor_ = ::open(path_.c_str(), kFlags | O_CREAT | O_EXCL, 0600);
    if (descriptor_ != -1) {
      (void)fchmod(descriptor_, 0600);
      // Otherwise a lock that root creates would shut out the file's owner.
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
  // The lock is written to: it must not be a hard link to some other file.
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

// Only informs other users: the lock also works if the disk is full.
void EditLock::writeHolder() const {
  const std::string text = holderRecord() + "\n";
  if (ftruncate(descriptor_, 0) == 0) (void)!pwrite(descriptor_, text.data(), text.size(), 0);
}

// fcntl knows the process unless it has ended or is in another PID namespace; the file has the
// command.
std::string EditLock::holder() const {
  char text[kMaxCommandLength + 32];
  const ssize_t size = pread(descriptor_, text, sizeof text, 0);
  // A Failure ends at a null character.
  std::string recorded =
      printable(std::string_view(text, size > 0 ? static_cast<size_t>(size) : 0), "\n");
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
