// --verbose: the library's debug messages on standard error.
//
// The library passes its debug messages to functions of the platform libraries. The functions below
// take precedence over them: they print the message and then call the platform's function.
#include <dlfcn.h>
#include <ldtr.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>

#include <exception>
#include <memory>

#include "command.h"

namespace {

bool is_verbose = false;
bool keeps_debug_records = true;  // if TRC_EVENTS selects them

template <typename Function>
Function* platformFunction(const char* name) {
  return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

// Appends the text of the error number after "errno", unless the message already has it.
void explainErrorNumber(std::string& message) {
  const size_t word = message.find("errno");
  if (word == std::string::npos) return;
  const size_t number = message.find_first_not_of(" =", word + strlen("errno"));
  const size_t end = std::min(message.find_first_not_of("0123456789", number), message.size());
  if (number >= end || message.compare(end, 3, " - ") == 0) return;
  message.insert(end, std::string(" (") + strerror(atoi(message.c_str() + number)) + ")");
}

void printMessage(const char* format, va_list arguments, bool has_error_number) {
  va_list copy;
  va_copy(copy, arguments);
  char* text = nullptr;
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  const int size = vasprintf(&text, format, copy);
#pragma GCC diagnostic pop
  va_end(copy);
  if (size < 0) return;
  const osutils::Owned<char> owner(text);
  try {
    std::string message(text, static_cast<size_t>(size));
    message.erase(message.find_last_not_of(" \n") + 1);
    if (has_error_number) explainErrorNumber(message);
    (void)fputs((printable(message) + '\n').c_str(), stderr);
  } catch (const std::exception&) {  // must not reach the library
  }
}

}  // namespace

extern "C" {

#pragma GCC visibility push(default)

void PrintDebugVa(unsigned int level, const char* format, va_list arguments) {
  if (is_verbose) printMessage(format, arguments, true);
  static auto* const platform_function =
      platformFunction<void(unsigned int, const char*, va_list)>("PrintDebugVa");
  if (platform_function != nullptr) platform_function(level, format, arguments);
}

// Called by the resolver, whose "errno" is a code of its own.
void PrintDebug(unsigned int level, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  if (is_verbose) printMessage(format, arguments, false);
  static auto* const platform_function =
      platformFunction<void(unsigned int, const char*, va_list)>("PrintDebugVa");
  if (platform_function != nullptr) platform_function(level, format, arguments);
  va_end(arguments);
}

int read_ldap_debug() {
  static auto* const platform_function = platformFunction<int()>("read_ldap_debug");
  return is_verbose ? 1 : platform_function != nullptr ? platform_function() : 0;
}

void trcWriteRec(uint64_t type, uint64_t id, const void* object, uint64_t length, const void* data,
                 uint64_t a, uint64_t b, uint64_t c, uint64_t d) {
  if (!keeps_debug_records && (type == LDTR_TYPE_DEBUG || type == LDTR_TYPE_DEBUG_ERROR)) return;
  static auto* const platform_function =
      platformFunction<void(uint64_t, uint64_t, const void*, uint64_t, const void*, uint64_t,
                            uint64_t, uint64_t, uint64_t)>("trcWriteRec");
  if (platform_function != nullptr) platform_function(type, id, object, length, data, a, b, c, d);
}

#pragma GCC visibility pop
}

void startVerbosity() {
  is_verbose = true;
  keeps_debug_records = ldtr_traces(LDTR_EVENT_DEBUG);
  __atomic_fetch_or(&trcEvents, LDTR_EVENT_DEBUG, __ATOMIC_RELAXED);
}
