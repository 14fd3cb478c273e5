// Values that a fuzz target cuts from its input.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <string.h>

#include <algorithm>
#include <string>
#include <string_view>

class Input {
 public:
  Input(const uint8_t* data, size_t size) : rest_(reinterpret_cast<const char*>(data), size) {}

  bool isAtEnd() const { return rest_.empty(); }

  // Little-endian; bytes after the end are 0.
  template <typename Number>
  Number number() {
    Number value = 0;
    const std::string_view bytes = take(sizeof value);
    if (!bytes.empty()) memcpy(&value, bytes.data(), bytes.size());
    return value;
  }
  uint8_t byte() { return number<uint8_t>(); }

  // The text up to the next NUL, which is skipped, or to the end.
  std::string text() {
    const size_t length = std::min(rest_.find('\0'), rest_.size());
    std::string taken(take(length));
    (void)take(1);
    return taken;
  }

  std::string_view rest() const { return rest_; }

 private:
  std::string_view take(size_t most) {
    const std::string_view taken = rest_.substr(0, most);
    rest_.remove_prefix(taken.size());
    return taken;
  }

  std::string_view rest_;
};
