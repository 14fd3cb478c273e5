// Opening files in a program that may have closed its standard streams.
#pragma once

#include <fcntl.h>
#include <sys/types.h>
#include <unistd.h>

#include "errno_saver.h"

// Occupies the descriptors of the standard streams that the program has closed, so that no file gets them. Reads and
// writes fail on an O_PATH descriptor as on a closed one.
class StandardStreamPlaceholders {
 public:
  StandardStreamPlaceholders() {
    for (int stream = 0; stream <= STDERR_FILENO; ++stream) {
      descriptors_[stream] = fcntl(stream, F_GETFD) < 0 ? open("/", O_PATH | O_CLOEXEC) : -1;
    }
  }
  ~StandardStreamPlaceholders() {
    const osutils::ErrnoSaver saved_errno;
    for (const int descriptor : descriptors_) {
      // Another thread may have replaced it with a stream.
      if (descriptor >= 0 && (fcntl(descriptor, F_GETFL) & O_PATH) != 0) (void)close(descriptor);
    }
  }
  StandardStreamPlaceholders(const StandardStreamPlaceholders&) = delete;
  StandardStreamPlaceholders& operator=(const StandardStreamPlaceholders&) = delete;

 private:
  int descriptors_[STDERR_FILENO + 1];
};

// openat() that never returns the descriptor of a standard stream: what the program prints to a closed stream must not
// end up in the file.
inline int openAboveStandardStreams(int directory, const char* path, int flags, mode_t mode = 0) {
  const StandardStreamPlaceholders placeholders;
  const int descriptor = openat(directory, path, flags | O_CLOEXEC, mode);
  if (descriptor < 0 || descriptor > STDERR_FILENO) return descriptor;
  // Another thread has closed a stream since the constructor ran.
  const int above = fcntl(descriptor, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
  (void)close(descriptor);
  return above;
}
