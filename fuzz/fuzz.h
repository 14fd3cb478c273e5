// What the fuzz targets share.
#pragma once

#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#include <string>
#include <string_view>

// The text with its unprintable bytes escaped.
inline std::string shown(std::string_view text) {
  std::string out = "\"";
  for (const char c : text) {
    if (c >= ' ' && c <= '~' && c != '"' && c != '\\') {
      out += c;
    } else {
      char escaped[5];
      snprintf(escaped, sizeof escaped, "\\x%02X", static_cast<unsigned>(static_cast<uint8_t>(c)));
      out += escaped;
    }
  }
  return out + "\"";
}

// Ends the program, as a sanitizer's report does.
[[noreturn]] inline void fail(const char* what, const std::string& ours,
                              const std::string& expected) {
  fprintf(stderr, "%s\n  ours:  %s\n  model: %s\n", what, ours.c_str(), expected.c_str());
  abort();
}

inline void expectSame(const char* what, std::string_view ours, std::string_view expected) {
  if (ours != expected) fail(what, shown(ours), shown(expected));
}

inline void expectSame(const char* what, long ours, long expected) {
  if (ours != expected) fail(what, std::to_string(ours), std::to_string(expected));
}
