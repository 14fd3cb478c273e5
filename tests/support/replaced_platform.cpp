// The platform functions that this test program defines, except those that trace or print.

#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "platform.h"
#include "replaced.h"

using faults::allocated;
using faults::failed;

namespace {

thread_local const OddPrint* odd_print = nullptr;

}  // namespace

OddPrint::OddPrint(int answer, Leaves leaves) : answer_(answer), leaves_(leaves) {
  odd_print = this;
}
OddPrint::~OddPrint() { odd_print = nullptr; }

EXPORTED int vra_vsnprintf(char* buffer, size_t size, const char* format, va_list arguments) {
  if (const auto error = STRIKE(vra_vsnprintf)) return failed(*error, -1);
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  return vsnprintf(buffer, size, format, arguments);
#pragma GCC diagnostic pop
}

EXPORTED int vra_snprintf(char* buffer, size_t size, const char* format, ...) {
  if (FROM_LIBRARY()) passed.print_size = size;
  if (const auto error = STRIKE(vra_snprintf)) return failed(*error, -1);
  va_list arguments;
  va_start(arguments, format);
  const int length = vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  return odd_print != nullptr && FROM_LIBRARY() ? odd_print->answer() : length;
}

EXPORTED int vra_asprintf(char** out, const char* format, ...) {
  if (const auto error = STRIKE(vra_asprintf)) return failed(*error, -1);
  va_list arguments;
  va_start(arguments, format);
  const int length = vasprintf(out, format, arguments);
  va_end(arguments);
  if (length == -1) return -1;
  (void)allocated(*out, __builtin_return_address(0));
  if (odd_print == nullptr || !FROM_LIBRARY()) return length;
  if (odd_print->leaves() == OddPrint::kNull) {
    free(*out);
    *out = nullptr;
  }
  return odd_print->answer();
}

EXPORTED size_t vra_strlcpy(char* destination, const char* source, size_t size) {
  if (const auto error = STRIKE(vra_strlcpy)) return static_cast<size_t>(*error);
  const size_t length = strlen(source);
  if (size != 0) {
    const size_t copied = length < size ? length : size - 1;
    memcpy(destination, source, copied);
    destination[copied] = '\0';
  }
  return length;
}

EXPORTED int default_autolock;
EXPORTED int configfile_read;
EXPORTED int al_configfile_counter;
int default_autolock = 0;
int configfile_read = 1;
int al_configfile_counter = 0;

EXPORTED char* ldap_getenv(const char* name) {
  if (const auto error = STRIKE(ldap_getenv)) return failed<char*>(*error, nullptr);
  const char* const value = getenv(name);
  if (value == nullptr) return nullptr;
  return static_cast<char*>(allocated(strdup(value), __builtin_return_address(0)));
}

EXPORTED int ldap_putenv(char* assignment) {
  if (const auto error = STRIKE(ldap_putenv)) return *error;
  return putenv(assignment);
}
