// Text that the views write while they read, because a whole answer would not fit into memory.
#pragma once

#include <stdio.h>

#include <charconv>
#include <concepts>
#include <string>
#include <string_view>
#include <vector>

#include "calls.h"

namespace traces {

// In quotes. Invalid UTF-8 becomes U+FFFD.
std::string jsonText(std::string_view text);

// Appends a number without the locale.
template <std::integral Number>
void append(std::string& text, Number number) {
  char digits[24];
  const auto [end, error] = std::to_chars(digits, digits + sizeof digits, number);
  text.append(digits, end);
}

// The names of functions as JSON texts, made once.
class FunctionTexts {
 public:
  const std::string& of(const Function& function);

 private:
  std::vector<std::string> texts_;
};

// Calls and messages as JSON objects.
class JsonObjects {
 public:
  // Without an end yet if it has begun.
  std::string of(const Call& call, bool has_only_begun = false);
  std::string of(const Message& message);

 private:
  std::string opening(const Thread& thread, const Function& function, unsigned depth);

  FunctionTexts functions_;
  const Process* process_ = nullptr;
  std::string process_text_;
};

// A file to which text is written piece by piece.
class Output {
 public:
  // `name` is the file in the message of a failure.
  Output(FILE* file, std::string name) : file_(file), name_(std::move(name)) {}
  void add(std::string_view text);
  void write();  // what is added

 private:
  FILE* file_;
  std::string name_;
  std::string text_;
};

}  // namespace traces
