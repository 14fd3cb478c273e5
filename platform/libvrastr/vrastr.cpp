// libvrastr: bounded and allocating formatting.
//
//   vra_asprintf    the length, and in `*out` a new string that the caller frees; exactly -1, with null
//                   in `*out`, on any failure
//   vra_snprintf    the length that the whole text has, also when it was cut to fit; a text of that
//   vra_vsnprintf   length or more than `size` - 1 is cut. Any `size` is taken, 0 only measures. -1, with
//                   the empty string in the buffer, on any failure
//   vra_strlcpy     the length of `source`; the copy is cut to fit. Nothing is written when `size` is 0
//
// A null `format` or `out`, or a null buffer that is not only measured, is a failure. vra_strlcpy takes a
// null source as the empty string and writes nothing to a null destination.

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

  // A C library may refuse a bound above INT_MAX. No text is longer than that, so nothing is lost.
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
