#include "vraldapiconv.h"

#include <errno.h>
#include <iconv.h>
#include <langinfo.h>
#include <string.h>

long vraldap_from_utf8(const char* code_set, const char* text, char* buffer, size_t size) {
  if (buffer != nullptr && size > 0) buffer[0] = '\0';
  if (text == nullptr || buffer == nullptr || size == 0) {
    errno = EINVAL;
    return -1;
  }

  const iconv_t converter =
      iconv_open(code_set == nullptr ? nl_langinfo(CODESET) : code_set, "UTF-8");
  // NOLINTNEXTLINE(performance-no-int-to-ptr): the failure value that the interface defines
  if (converter == reinterpret_cast<iconv_t>(-1)) return -1;

  char* in = const_cast<char*>(text);  // iconv() does not write through it
  size_t in_left = strlen(text);
  char* out = buffer;
  size_t out_left = size - 1;
  // The second call returns to the initial shift state.
  const bool converted =
      iconv(converter, &in, &in_left, &out, &out_left) != static_cast<size_t>(-1) &&
      iconv(converter, nullptr, nullptr, &out, &out_left) != static_cast<size_t>(-1);
  const int error = errno;
  (void)iconv_close(converter);

  if (!converted) {
    buffer[0] = '\0';
    errno = error;
    return -1;
  }
  *out = '\0';
  return out - buffer;
}
