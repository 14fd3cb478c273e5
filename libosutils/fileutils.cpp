// Files: questions about a path, operations on whole files, and who owns a file.

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <stdlib.h>
#include <string.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>

#include "cancellation.h"
#include "osutils.h"
#include "owned.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::OwnedStream;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

// On the stack, which may be that of a small thread.
constexpr size_t kCopyBlockBytes = size_t{2} * 1024;
constexpr size_t kLargestKernelCopy = size_t{1} << 30;

// What the look-ups of an owner start with and grow to, by doubling.
constexpr int kFirstLookUpBytes = 2048;
constexpr int kLastLookUpBytes = 128 * 1024 * 1024;

class DescriptorCloser {
 public:
  explicit DescriptorCloser(int descriptor) : descriptor_(descriptor) {}
  ~DescriptorCloser() { (void)close(descriptor_); }
  DescriptorCloser(const DescriptorCloser&) = delete;
  DescriptorCloser& operator=(const DescriptorCloser&) = delete;

 private:
  int descriptor_;
};

// Calls `move` until there is nothing left to move. False when it fails.
template <typename Move>
bool moveAll(Move move) {
  ssize_t moved = 0;
  do {
    moved = move();
  } while (moved > 0 || (moved == -1 && errno == EINTR));
  return moved == 0;
}

// Everything from the source's current position to its end, as a loop over single characters would
// copy it: a failed write goes unnoticed, and the source is read to its end all the same, because a
// pipe's writer would see the difference.
void copyToEnd(int source, int destination) {
  const bool copied = moveAll([&] {
    return copy_file_range(source, nullptr, destination, nullptr, kLargestKernelCopy, 0);
  });
  // Between two file systems. Only files get this far: a pipe would be given the source's own
  // pages.
  if (!copied && errno == EXDEV) {
    (void)moveAll([&] { return sendfile64(destination, source, nullptr, kLargestKernelCopy); });
  }

  // The rest, or all of it where the kernel cannot copy by itself: pipes, devices, files that have
  // no size before they are read.
  char block[kCopyBlockBytes];
  bool writes = true;
  for (;;) {
    const ssize_t got = read(source, block, sizeof block);
    if (got == -1 && errno == EINTR) continue;
    if (got <= 0) return;
    for (ssize_t done = 0; writes && done < got;) {
      const ssize_t put = write(destination, block + done, static_cast<size_t>(got - done));
      if (put == -1 && errno == EINTR) continue;
      // Never go on behind a gap: what was written stays the beginning of the source.
      writes = put > 0;
      if (writes) done += put;
    }
  }
}

// Looks up an account record with a buffer that grows until the record fits. False when there is no
// answer, with the reason in a debug message.
//   function, buffer_name  as the messages call them
//   buffer, size           grown in place; the buffer stays the caller's
//   look_up                calls the reentrant function and returns its error number
template <typename Trace, typename LookUp>
bool lookUpGrowing(Trace& trace, const char* function, const char* buffer_name, OwnedString& buffer,
                   LookUp look_up) {
  for (int size = kFirstLookUpBytes;;) {
    const int error = look_up(buffer.get(), static_cast<size_t>(size));
    if (error == 0) {
      DEBUG_MESSAGE(trace,
                    "getFileOwnersAndPermissions: %s invocation SUCCESSFUL with allocation at %d\n",
                    function, size);
      return true;
    }
    if (error != ERANGE) {
      DEBUG_MESSAGE(trace,
                    "getFileOwnersAndPermissions: %s invocation returned non-zero return code=%d\n",
                    function, error);
      return false;
    }
    DEBUG_MESSAGE(
        trace, "getFileOwnersAndPermissions: %s invocation returned ERANGE with allocation at %d\n",
        function, size);
    size *= 2;
    if (size > kLastLookUpBytes) {
      DEBUG_MESSAGE(trace,
                    "getFileOwnersAndPermissions: %s terminating with next allocation at %d\n",
                    function, size);
      return false;
    }
    // The old buffer is lost when the new one cannot be had: intended, callers' memory accounting
    // knows of it.
    buffer.reset(static_cast<char*>(realloc(buffer.release(), static_cast<size_t>(size))));
    if (!buffer) {
      DEBUG_MESSAGE(trace,
                    "getFileOwnersAndPermissions: the realloc for the %s size amount - value=%d\n",
                    buffer_name, size);
      return false;
    }
  }
}

}  // namespace

// ---- Queries ----

TRACED bool doesFileExist(const char* path) {
  TraceScope<traced::doesFileExist> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "doesFileExist: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    DEBUG_MESSAGE(trace, "doesFileExist: stat() - errno=%d\n", errno);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED bool canAccessFile(const char* path) {
  TraceScope<traced::canAccessFile> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "canAccessFile: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    const int error = errno;
    DEBUG_MESSAGE(trace, "canAccessFile: stat() - errno=%d\n", error);
    // A missing file is accessible: callers tell it from a forbidden one by this very answer.
    return trace.result(error != EACCES);
  }
  return trace.result(true);
}

TRACED bool isDirectory(const char* path) {
  TraceScope<traced::isDirectory> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "isDirectory: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    DEBUG_MESSAGE(trace, "isDirectory: stat() - errno=%d\n", errno);
    return trace.result(false);
  }
  // One bit, not S_ISDIR: block devices and sockets have it too, and count as directories.
  return trace.result((status.st_mode & S_IFDIR) != 0);
}

TRACED bool isFile(char* path) {
  TraceScope<traced::isFile> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "isFile: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    DEBUG_MESSAGE(trace, "isFile: stat() - errno=%d\n", errno);
    return trace.result(false);
  }
  // One bit, not S_ISREG: sockets have it too, and links were followed.
  return trace.result((status.st_mode & S_IFREG) != 0);
}

TRACED bool canWriteToFile(char* path) {
  TraceScope<traced::canWriteToFile> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "canWriteToFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);

  // Makes the file when it is missing, and leaves it: callers count on finding it afterwards.
  const OwnedStream stream(fopen64(path, "ab"));
  if (!stream) {
    DEBUG_MESSAGE(trace, "canWriteToFile: fopen - errno =%d\n", errno);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED int checkFilePerms(const char* path) {
  TraceScope<traced::checkFilePerms> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "checkFilePerms: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (doesFileExist(path)) {
    if (isDirectory(path)) {
      // The one message of the queries at the error level.
      ERROR_MESSAGE(trace, "checkFilePerms - %s is a directory.\n", path);
      return trace.result(OSUTILS_CONSTRAINT_VIOLATION);
    }
    return trace.result(OSUTILS_SUCCESS);
  }
  if (canAccessFile(path)) {
    DEBUG_MESSAGE(trace, "checkFilePerms - The file %s does not exist.\n", path);
    return trace.result(OSUTILS_NO_SUCH_OBJECT);
  }
  DEBUG_MESSAGE(trace, "checkFilePerms - The file %s cannot be accessed.\n", path);
  return trace.result(OSUTILS_INSUFFICIENT_ACCESS);
}

// ---- Operations ----

TRACED bool copyFile(const char* source, char* destination, char* user, char* group,
                     unsigned int mode) {
  TraceScope<traced::copyFile> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (source == nullptr || destination == nullptr) {
    DEBUG_MESSAGE(trace, "copyFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (!doesFileExist(source) || !canAccessFile(source) || isDirectory(source)) {
    return trace.result(false);
  }
  if (doesFileExist(destination)) {
    if (!canWriteToFile(destination)) return trace.result(false);
  } else {
    if (!canAccessFile(destination)) return trace.result(false);
    if (!createFile(destination, user, group, mode)) {
      DEBUG_MESSAGE(trace, "copyFile: Cannot create destination file\n");
      return trace.result(false);
    }
  }

  OwnedStream from(fopen64(source, "rb"));
  if (!from) {
    ERROR_MESSAGE(trace, "copyFile: (1) fopen - errno =%d\n", errno);
    return trace.result(false);
  }
  // Emptied before a byte is read: a file that is copied onto itself ends empty.
  const OwnedStream to(fopen64(destination, "wb"));
  if (!to) {
    // Says "(1)" as well: one text for both opens.
    ERROR_MESSAGE(trace, "copyFile: (1) fopen - errno =%d\n", errno);
    return trace.result(false);
  }
  copyToEnd(fileno_unlocked(from.get()), fileno_unlocked(to.get()));
  from.reset();  // the source is closed first
  return trace.result(true);
}

TRACED bool createFile(char* path, char* user, char* group, unsigned int mode) {
  TraceScope<traced::createFile> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "createFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (doesFileExist(path)) {
    // A new file unless this fails: then the old one keeps its contents and gets the owner and
    // mode.
    (void)deleteFile(path);
  } else if (!canAccessFile(path)) {
    return trace.result(false);
  }

  (void)umask(22);  // decimal on purpose: octal 026. It stays set; callers make files under it.
  const int descriptor = open64(path, O_RDWR | O_CREAT, 0640);
  if (descriptor == -1) {
    ERROR_MESSAGE(trace, "createFile: open - errno =%d\n", errno);
    return trace.result(false);
  }
  if (!setFileOwnersAndPermissions(descriptor, path, user, group, mode)) {
    ERROR_MESSAGE(trace, "createFile: Cannot set the file permissions\n");
    (void)close(descriptor);
    (void)deleteFile(path);
    return trace.result(false);
  }
  if (close(descriptor) != 0) {
    DEBUG_MESSAGE(trace, "createFile: close - errno =%d\n", errno);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED bool deleteFile(char* path) {
  TraceScope<traced::deleteFile> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "deleteFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);
  if (remove(path) != 0) {
    DEBUG_MESSAGE(trace, "deleteFile: remove - errno =%d\n", errno);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED bool clearFile(const char* path) {
  TraceScope<traced::clearFile> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "clearFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);

  // The numbers in the two messages run against their order.
  const int descriptor = open64(path, O_WRONLY | O_CREAT | O_DSYNC, 0600);
  if (descriptor == -1) {
    const int error = errno;
    ERROR_MESSAGE(trace, "clearFile: (2) failed to truncate file. errno=%d - %s\n", error,
                  strerror(error));
    return trace.result(false);
  }
  const DescriptorCloser closer(descriptor);
  {
    // A thread that is cancelled here ends here: the wait may be for ever.
    const CancellationState waiting(held.before());
    // Until it succeeds, whatever the reason: nobody empties the file without the lock.
    while (lockf64(descriptor, F_LOCK, 0) != 0) {
    }
  }
  const bool cleared = ftruncate64(descriptor, 0) == 0;
  if (!cleared) {
    const int error = errno;
    ERROR_MESSAGE(trace, "clearFile: (1) failed to truncate file. errno=%d - %s\n", error,
                  strerror(error));
  }
  (void)lockf64(descriptor, F_ULOCK, 0);
  return trace.result(cleared);
}

TRACED bool readFile(const char* path, char** out) {
  TraceScope<traced::readFile> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "readFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);
  OwnedStream stream(fopen64(path, "r"));
  if (!stream) return trace.result(false);

  (void)fseeko64(stream.get(), 0, SEEK_END);
  const int size = static_cast<int>(ftello64(stream.get()));
  rewind(stream.get());
  // A pipe's -1 and a file of 2 GiB or more ask for more than there is; from 4 GiB on only the low
  // half of the size counts.
  const size_t bytes = static_cast<size_t>(size);
  *out = static_cast<char*>(calloc(1, bytes));
  if (*out == nullptr) {
    (void)stream.release();  // stays open: intended, the callers' descriptor accounting knows of it
    return trace.result(false);
  }
  // How much there was to read is not part of the answer; what is missing reads as zeros.
  (void)!fread(*out, 1, bytes, stream.get());
  return trace.result(true);
}

TRACED char* getFileNameFromPath(const char* path) {
  TraceScope<traced::getFileNameFromPath> trace;

  if (path == nullptr) {
    ERROR_MESSAGE(trace, "Error - getFileNameFromPath: path is NULL\n");
    return nullptr;
  }
  const char* separator = strrchr(path, '/');
  if (separator == nullptr) separator = strrchr(path, '\\');
  return strdup(separator == nullptr ? path : separator + 1);
}

// ---- Ownership ----

TRACED bool getFileOwnersAndPermissions(const char* path, char** owner, char** group,
                                        unsigned int* mode) {
  TraceScope<traced::getFileOwnersAndPermissions> trace;
  const CancellationState held(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr || owner == nullptr || group == nullptr) {
    DEBUG_MESSAGE(trace, "getFileOwnersAndPermissions: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    DEBUG_MESSAGE(trace, "getFileOwnersAndPermissions: stat() - errno=%d\n", errno);
    return trace.result(false);
  }

  OwnedString user_buffer(static_cast<char*>(malloc(kFirstLookUpBytes)));
  if (!user_buffer) {
    DEBUG_MESSAGE(trace,
                  "getFileOwnersAndPermissions: the malloc for the sysconf password buffer size "
                  "maximum failed - value=%d\n",
                  kFirstLookUpBytes);
    return trace.result(false);
  }
  OwnedString group_buffer(static_cast<char*>(malloc(kFirstLookUpBytes)));
  if (!group_buffer) {
    DEBUG_MESSAGE(trace,
                  "getFileOwnersAndPermissions: the malloc for the sysconf group buffer size "
                  "maximum failed - value=%d\n",
                  kFirstLookUpBytes);
    return trace.result(false);
  }

  passwd user_record = {};
  const auto look_up_user = [&](char* buffer, size_t size) {
    user_record = {};  // a record that did not fit left pointers into the old buffer
    passwd* found = nullptr;
    return getpwuid_r(status.st_uid, &user_record, buffer, size, &found);
  };
  if (!lookUpGrowing(trace, "getpwuid_r", "passwordbuffer", user_buffer, look_up_user)) {
    return trace.result(false);
  }
  struct group group_record = {};
  const auto look_up_group = [&](char* buffer, size_t size) {
    group_record = {};
    struct group* found = nullptr;
    return getgrgid_r(status.st_gid, &group_record, buffer, size, &found);
  };
  if (!lookUpGrowing(trace, "getgrgid_r", "group buffer", group_buffer, look_up_group)) {
    return trace.result(false);
  }

  // For an id without an account the C library answers success and may leave the line of another
  // account in the record: a name counts only with the id that was asked for.
  if (group_record.gr_name == nullptr || group_record.gr_gid != status.st_gid) {
    DEBUG_MESSAGE(
        trace,
        "getFileOwnersAndPermissions: the value of gidInfo.gr_name returned by getgrgid_r "
        "is NULL\n");
    return trace.result(false);
  }
  if (user_record.pw_name == nullptr || user_record.pw_uid != status.st_uid) {
    // Names getgrgid_r although this is getpwuid_r's record: the text is known as it stands.
    DEBUG_MESSAGE(
        trace,
        "getFileOwnersAndPermissions: the value of uidInfo.pw_name returned by getgrgid_r "
        "is NULL\n");
    return trace.result(false);
  }
  *group = strdup(group_record.gr_name);
  *owner = strdup(user_record.pw_name);
  *mode = status.st_mode;
  return trace.result(true);
}
