// Character classes and words that do not depend on the program's locale.
#pragma once

namespace osutils {

constexpr bool isSpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }
constexpr bool isDigit(char c) { return c >= '0' && c <= '9'; }
constexpr bool isLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }

constexpr bool isNullOrEmpty(const char* text) { return text == nullptr || text[0] == '\0'; }

inline const char* skipSpace(const char* text) {
  while (isSpace(*text)) ++text;
  return text;
}
inline const char* skipWord(const char* text) {
  while (*text != '\0' && !isSpace(*text)) ++text;
  return text;
}

}  // namespace osutils
