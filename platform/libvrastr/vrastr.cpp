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
#include <charconv>
#include <limits>

#include "platform.h"

namespace {

// Formats a text with no other conversions than %s and %d, which nearly all messages are, in a fraction of the time of
// vsnprintf(). Returns -1 and leaves any bytes in the buffer if it cannot.
__attribute__((format(printf, 3, 0))) int formatPlain(char* buffer, size_t size, const char* format,
                                                      va_list arguments) {
  size_t length = 0;
  const auto add = [&](const char* text, size_t bytes) {
    if (length < size) memcpy(buffer + length, text, std::min(bytes, size - length));
    length += bytes;
  };
  const char* conversion = strchrnul(format, '%');
  while (*conversion != '\0') {
    add(format, static_cast<size_t>(conversion - format));
    if (conversion[1] == 's') {
      const char* const text = va_arg(arguments, const char*);
      if (text == nullptr) return -1;
      add(text, strlen(text));
    } else if (conversion[1] == 'd') {
      char digits[std::numeric_limits<int>::digits10 + 2];
      const char* const end =
          std::to_chars(digits, digits + sizeof digits, va_arg(arguments, int)).ptr;
      add(digits, static_cast<size_t>(end - digits));
    } else {
      return -1;
    }
    format = conversion + 2;
    conversion = strchrnul(format, '%');
  }
  add(format, static_cast<size_t>(conversion - format));
  if (length > INT_MAX) return -1;
  if (size > 0) buffer[std::min(length, size - 1)] = '\0';
  return static_cast<int>(length);
}

}  // namespace

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

  va_list copy;
  va_copy(copy, arguments);
  const int plain = formatPlain(buffer, size, format, copy);
  va_end(copy);
  if (plain >= 0) return plain;

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
