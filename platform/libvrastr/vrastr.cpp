// libvrastr: bounded and allocating formatting.
//
//   vra_asprintf    returns the length, and in `*out` a new string that the caller frees; after any failure exactly -1,
//                   and null in `*out`
//   vra_snprintf    return the length of the whole text, of which at most `size` - 1 bytes are written; with size 0
//   vra_vsnprintf   nothing is written. After any failure -1, and the empty string in the buffer
//   vra_strlcpy     returns the length of `source`, of which at most `size` - 1 bytes are copied; with size 0
//                   nothing is written
//
// A null `format` or `out`, or a null buffer with a size above 0, is a failure. vra_strlcpy treats a null source as the
// empty string and writes nothing to a null destination.

#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>

#include <algorithm>

#include "platform.h"

int vra_asprintf(char** out, const char* format, ...) {
  if (out == nullptr) {
    errno = EINVAL;
    return -1;
  }
  *out = nullptr;
  if (format == nullptr) {
    errno = EINVAL;
    return -1;
  }

  va_list arguments;
  va_start(arguments, format);
  const int length = vasprintf(out, format, arguments);
  va_end(arguments);
  if (length < 0) {
    *out = nullptr;  // the C library leaves it undefined
    return -1;
  }
  return length;
}

int vra_snprintf(char* buffer, size_t size, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const int length = vra_vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  return length;
}

int vra_vsnprintf(char* buffer, size_t size, const char* format, va_list arguments) {
  if (format == nullptr || (buffer == nullptr && size > 0)) {
    if (buffer != nullptr && size > 0) buffer[0] = '\0';
    errno = EINVAL;
    return -1;
  }

  // A C library may reject a size above INT_MAX. No text is longer.
  const int length = vsnprintf(buffer, std::min(size, size_t{INT_MAX}), format, arguments);
  if (length < 0) {
    if (size > 0) buffer[0] = '\0';
    return -1;
  }
  return length;
}

size_t vra_strlcpy(char* destination, const char* source, size_t size) {
  const size_t length = source == nullptr ? 0 : strlen(source);
  if (destination != nullptr && size > 0) {
    const size_t copied = std::min(length, size - 1);
    if (copied > 0) memcpy(destination, source, copied);
    destination[copied] = '\0';
  }
  return length;
}
