// Files: queries, operations on whole files, and ownership.

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
#include "descriptors.h"
#include "osutils.h"
#include "owned.h"
#include "resumed_stream.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::openStream;
using osutils::OwnedStream;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

// On the stack, which may be small.
constexpr size_t kCopyBlockBytes = size_t{2} * 1024;
constexpr size_t kMaxKernelCopyBytes = size_t{1} << 30;

// Buffer sizes for account look-ups, which double them from the initial one to the maximum.
constexpr int kInitialLookUpBytes = 2048;
constexpr int kMaxLookUpBytes = 128 * 1024 * 1024;

class OwnedDescriptor {
 public:
  explicit OwnedDescriptor(int descriptor) : descriptor_(descriptor) {}
  ~OwnedDescriptor() { (void)close(descriptor_); }
  OwnedDescriptor(const OwnedDescriptor&) = delete;
  OwnedDescriptor& operator=(const OwnedDescriptor&) = delete;

 private:
  int descriptor_;
};

// Calls `transfer` until it returns 0. Returns false if it fails; an interrupted call is repeated.
template <typename Transfer>
bool transferAll(Transfer transfer) {
  ssize_t transferred = 0;
  do {
    transferred = transfer();
  } while (transferred > 0 || (transferred == -1 && errno == EINTR));
  return transferred == 0;
}

// Copies the source from its current position to its end. A failed write is not reported, and the
// source is still read to its end: the writer of a pipe would otherwise get SIGPIPE.
void copyToEnd(int source, int destination) {
  const bool copied = transferAll([&] {
    return copy_file_range(source, nullptr, destination, nullptr, kMaxKernelCopyBytes, 0);
  });
  // Between two file systems. The destination is a regular file here: with a pipe, sendfile64 would
  // share the source's pages instead of copying them.
  if (!copied && errno == EXDEV) {
    (void)transferAll(
        [&] { return sendfile64(destination, source, nullptr, kMaxKernelCopyBytes); });
  }

  // What the kernel has not copied: pipes, devices, and files whose size is 0 until they are read,
  // such as those in /proc.
  char block[kCopyBlockBytes];
  bool can_write = true;
  for (;;) {
    const ssize_t bytes_read = read(source, block, sizeof block);
    if (bytes_read == -1 && errno == EINTR) continue;
    if (bytes_read <= 0) return;
    for (ssize_t done = 0; can_write && done < bytes_read;) {
      const ssize_t bytes_written =
          write(destination, block + done, static_cast<size_t>(bytes_read - done));
      if (bytes_written == -1 && errno == EINTR) continue;
      // Write nothing after a failure, so that the copy remains the beginning of the source.
      can_write = bytes_written > 0;
      if (can_write) done += bytes_written;
    }
  }
}

// Looks up an account record, and doubles the buffer until the record fits. Returns false after a
// failure, with the reason in a debug message.
//   function, buffer_name  names in the messages
//   look_up                calls the reentrant function and returns its error number
template <typename Trace, typename LookUp>
bool lookUpAccount(Trace& trace, const char* function, const char* buffer_name, OwnedString& buffer,
                   LookUp look_up) {
  for (int size = kInitialLookUpBytes;;) {
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
    if (size > kMaxLookUpBytes) {
      DEBUG_MESSAGE(trace,
                    "getFileOwnersAndPermissions: %s terminating with next allocation at %d\n",
                    function, size);
      return false;
    }
    // sic: leaked deliberately if realloc fails.
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
    // sic: only EACCES makes a file inaccessible, so a missing one is accessible.
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
  // sic: one bit, not S_ISDIR, so block devices and sockets are directories.
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
  // sic: one bit, not S_ISREG, so sockets are files.
  return trace.result((status.st_mode & S_IFREG) != 0);
}

TRACED bool canWriteToFile(char* path) {
  TraceScope<traced::canWriteToFile> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "canWriteToFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);

  // sic: creates a missing file and leaves it.
  const OwnedStream stream = openStream(path, "ab");
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
      // sic: the error level, unlike the other messages of the queries.
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

namespace {

// Never as a closed standard stream: what the program prints would be written to the file.
int openToWrite(const char* path, int flags, mode_t mode) {
  const StandardStreamPlaceholders placeholders;
  return open64(path, flags, mode);
}

}  // namespace

TRACED bool copyFile(const char* source, char* destination, char* user, char* group,
                     unsigned int mode) {
  TraceScope<traced::copyFile> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

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

  OwnedStream from = openStream(source, "rb");
  if (!from) {
    ERROR_MESSAGE(trace, "copyFile: (1) fopen - errno =%d\n", errno);
    return trace.result(false);
  }
  // sic: truncated before the first read, so a file copied onto itself becomes empty.
  const OwnedStream to = openStream(destination, "wb");
  if (!to) {
    // sic: "(1)" again.
    ERROR_MESSAGE(trace, "copyFile: (1) fopen - errno =%d\n", errno);
    return trace.result(false);
  }
  copyToEnd(fileno_unlocked(from.get()), fileno_unlocked(to.get()));
  from.reset();  // before the destination
  return trace.result(true);
}

TRACED bool createFile(char* path, char* user, char* group, unsigned int mode) {
  TraceScope<traced::createFile> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "createFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (doesFileExist(path)) {
    // If this fails, the old file keeps its contents and gets the new owner and mode.
    (void)deleteFile(path);
  } else if (!canAccessFile(path)) {
    return trace.result(false);
  }

  (void)umask(22);  // sic: decimal, that is octal 026, and not restored
  const int descriptor = openToWrite(path, O_RDWR | O_CREAT, 0640);
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
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "clearFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);

  // sic: message (2) precedes message (1).
  const int descriptor = openToWrite(path, O_WRONLY | O_CREAT | O_DSYNC, 0600);
  if (descriptor == -1) {
    const int error = errno;
    ERROR_MESSAGE(trace, "clearFile: (2) failed to truncate file. errno=%d - %s\n", error,
                  strerror(error));
    return trace.result(false);
  }
  const OwnedDescriptor owner(descriptor);
  {
    // The wait has no limit, so a thread can be cancelled in it.
    const CancellationState cancelable(no_cancel.previous());
    // Repeated after any error: the file must not be truncated without the lock.
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
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "readFile: passed a null pointer.\n");
    return trace.result(false);
  }
  if (isDirectory(path)) return trace.result(false);
  OwnedStream stream = openStream(path, "r");
  if (!stream) return trace.result(false);

  // EINVAL: a file without an end to seek, such as one in /proc. Its size is 0.
  // ESPIPE: a pipe, whose size is -1, for which calloc fails.
  if (fseeko64(stream.get(), 0, SEEK_END) != 0 && errno != EINVAL && errno != ESPIPE) {
    *out = nullptr;
    return trace.result(false);
  }
  const int size = static_cast<int>(ftello64(stream.get()));  // sic: sizes count modulo 4 GiB
  rewind(stream.get());
  const size_t bytes = static_cast<size_t>(size);
  *out = static_cast<char*>(calloc(1, bytes));
  if (*out == nullptr) {
    (void)stream.release();  // sic: leaked deliberately
    return trace.result(false);
  }
  // sic: a short read is not reported; the rest of the buffer is zero.
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
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (path == nullptr || owner == nullptr || group == nullptr) {
    DEBUG_MESSAGE(trace, "getFileOwnersAndPermissions: passed a null pointer.\n");
    return trace.result(false);
  }
  struct stat64 status;
  if (stat64(path, &status) != 0) {
    DEBUG_MESSAGE(trace, "getFileOwnersAndPermissions: stat() - errno=%d\n", errno);
    return trace.result(false);
  }

  OwnedString user_buffer(static_cast<char*>(malloc(kInitialLookUpBytes)));
  if (!user_buffer) {
    DEBUG_MESSAGE(trace,
                  "getFileOwnersAndPermissions: the malloc for the sysconf password buffer size "
                  "maximum failed - value=%d\n",
                  kInitialLookUpBytes);
    return trace.result(false);
  }
  OwnedString group_buffer(static_cast<char*>(malloc(kInitialLookUpBytes)));
  if (!group_buffer) {
    DEBUG_MESSAGE(trace,
                  "getFileOwnersAndPermissions: the malloc for the sysconf group buffer size "
                  "maximum failed - value=%d\n",
                  kInitialLookUpBytes);
    return trace.result(false);
  }

  passwd user_record = {};
  const auto look_up_user = [&](char* buffer, size_t size) {
    user_record = {};  // a failed look-up may leave pointers into the old buffer
    passwd* found = nullptr;
    return getpwuid_r(status.st_uid, &user_record, buffer, size, &found);
  };
  if (!lookUpAccount(trace, "getpwuid_r", "passwordbuffer", user_buffer, look_up_user)) {
    return trace.result(false);
  }
  struct group group_record = {};
  const auto look_up_group = [&](char* buffer, size_t size) {
    group_record = {};
    struct group* found = nullptr;
    return getgrgid_r(status.st_gid, &group_record, buffer, size, &found);
  };
  if (!lookUpAccount(trace, "getgrgid_r", "group buffer", group_buffer, look_up_group)) {
    return trace.result(false);
  }

  // For an unknown id the C library returns 0 and may leave another account in the record. So the
  // id is compared too.
  if (group_record.gr_name == nullptr || group_record.gr_gid != status.st_gid) {
    DEBUG_MESSAGE(
        trace,
        "getFileOwnersAndPermissions: the value of gidInfo.gr_name returned by getgrgid_r "
        "is NULL\n");
    return trace.result(false);
  }
  if (user_record.pw_name == nullptr || user_record.pw_uid != status.st_uid) {
    // sic: names getgrgid_r instead of getpwuid_r.
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
