// Streams of files that may be pipes, where opening and reading wait. Both continue after a signal.
#pragma once

#include <errno.h>
#include <stdio.h>

#include <optional>

#include "descriptors.h"
#include "owned.h"

namespace osutils {

inline OwnedStream openStream(const char* path, const char* mode) {
  std::optional<StandardStreamPlaceholders> placeholders;
  if (mode[0] != 'r') placeholders.emplace();  // nothing can be printed to a file that is only read
  FILE* stream = nullptr;
  do {
    stream = fopen64(path, mode);
  } while (stream == nullptr && errno == EINTR);
  return OwnedStream(stream);
}

// Returns less than `bytes` at the end and after a read error.
inline size_t readStream(FILE* stream, char* buffer, size_t bytes) {
  size_t got = fread_unlocked(buffer, 1, bytes, stream);
  while (got < bytes && ferror_unlocked(stream) != 0 && errno == EINTR) {
    clearerr_unlocked(stream);
    got += fread_unlocked(buffer + got, 1, bytes - got, stream);
  }
  return got;
}

}  // namespace osutils
