// Whether a text is one JSON value in UTF-8, by RFC 8259 and RFC 3629.
#pragma once

#include <stdint.h>
#include <string.h>

#include <string_view>

class JsonChecker {
 public:
  explicit JsonChecker(std::string_view text) : rest_(text) {}

  bool isValid() { return takeValue() && skipBlanks() && rest_.empty(); }

 private:
  char peek() const { return rest_.empty() ? '\0' : rest_.front(); }
  bool take(std::string_view token) {
    if (!rest_.starts_with(token)) return false;
    rest_.remove_prefix(token.size());
    return true;
  }
  bool skipBlanks() {
    while (!rest_.empty() && strchr(" \t\r\n", peek()) != nullptr && peek() != '\0')
      rest_.remove_prefix(1);
    return true;
  }
  bool takeDigits() {
    const size_t count = std::min(rest_.find_first_not_of("0123456789"), rest_.size());
    rest_.remove_prefix(count);
    return count != 0;
  }

  bool takeValue() {
    skipBlanks();
    switch (peek()) {
      case '{':
        return takeMembers('}', [this] {
          skipBlanks();
          return takeText() && skipBlanks() && take(":") && takeValue();
        });
      case '[':
        return takeMembers(']', [this] { return takeValue(); });
      case '"':
        return takeText();
      default:
        return take("true") || take("false") || take("null") || takeNumber();
    }
  }

  template <typename TakeMember>
  bool takeMembers(char end, TakeMember take_member) {
    const std::string_view end_token(&end, 1);
    rest_.remove_prefix(1);
    skipBlanks();
    if (take(end_token)) return true;
    do {
      if (!take_member()) return false;
      skipBlanks();
    } while (take(","));
    return take(end_token);
  }

  bool takeNumber() {
    (void)take("-");
    if (!take("0") && !takeDigits()) return false;
    if (take(".") && !takeDigits()) return false;
    if (take("e") || take("E")) {
      if (!take("+")) (void)take("-");
      return takeDigits();
    }
    return true;
  }

  bool takeText() {
    if (!take("\"")) return false;
    while (!rest_.empty() && peek() != '"') {
      if (peek() == '\\') {
        if (!takeEscape()) return false;
      } else if (!takeCharacter()) {
        return false;
      }
    }
    return take("\"");
  }

  bool takeEscape() {
    rest_.remove_prefix(1);
    if (take("u")) {
      const size_t digits =
          std::min(rest_.find_first_not_of("0123456789abcdefABCDEF"), rest_.size());
      if (digits < 4) return false;
      rest_.remove_prefix(4);
      return true;
    }
    if (rest_.empty() || strchr("\"\\/bfnrt", peek()) == nullptr) return false;
    rest_.remove_prefix(1);
    return true;
  }

  // The shortest form of a character that is neither a control character nor a surrogate.
  bool takeCharacter() {
    const auto byte = [this](size_t i) -> uint32_t {
      return i < rest_.size() ? static_cast<uint8_t>(rest_[i]) : 0;
    };
    const uint32_t first = byte(0);
    const size_t length = first < 0x80 ? 1 : first >= 0xF0 ? 4 : first >= 0xE0 ? 3 : 2;
    static constexpr uint32_t kLeast[] = {0x20, 0x80, 0x800, 0x10000};
    if (first >= 0xF8 || (first >= 0x80 && first < 0xC0)) return false;
    uint32_t character = length == 1 ? first : first & (0x7F >> length);
    for (size_t i = 1; i < length; ++i) {
      if ((byte(i) & 0xC0) != 0x80) return false;
      character = character << 6 | (byte(i) & 0x3F);
    }
    rest_.remove_prefix(length);
    return character >= kLeast[length - 1] && character <= 0x10FFFF &&
           (character < 0xD800 || character > 0xDFFF);
  }

  std::string_view rest_;
};
