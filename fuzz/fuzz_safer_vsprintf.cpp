// safer_vsprintf with any format, and with arguments that fit it, compared with the C library's
// vasprintf and a model of the bounds.
#include <stdarg.h>
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <array>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "fuzz.h"
#include "input.h"
#include "ldtr.h"

namespace {

constexpr size_t kMaxWhole = 64;
constexpr size_t kMaxFloating = 8;
constexpr int kMaxWidth = 2000;
constexpr size_t kLargestText = size_t{1} << 20;
constexpr char kUntouched = '\x5A';

// What ldtr.h says about the format alone: the result, or the format that is printed.
struct Bounded {
  int code;
  std::string format;
};

Bounded bounded(const std::string& format, int size) {
  if (static_cast<long>(format.size()) >= size) return {5, ""};
  if (format.size() > 499) return {6, ""};
  std::string out;
  size_t done = 0;
  size_t percent = 0;
  while ((percent = format.find('%', percent)) != std::string::npos) {
    const char next = format.c_str()[percent + 1];
    if (next == 's') {
      out.append(format, done, percent - done);
      if (out.size() + 9 > 500) return {7, ""};
      out += "%0.1000s";
      done = percent + 2;
    }
    percent += next == 's' || next == '%' ? 2 : 1;
  }
  out.append(format, done);
  if (out.size() + 1 > 500) return {7, ""};
  return {0, out};
}

// The arguments of a call. The C library takes whole numbers and pointers from one sequence and
// floating-point numbers from another one, on each of this library's architectures.
struct Arguments {
  std::vector<std::unique_ptr<char[]>> texts;
  std::array<long, kMaxWhole> whole = {};
  std::array<double, kMaxFloating> floating = {};
  size_t whole_count = 0;
  size_t floating_count = 0;

  bool add(long value) {
    if (whole_count == kMaxWhole) return false;
    whole[whole_count++] = value;
    return true;
  }
  bool add(double value) {
    if (floating_count == kMaxFloating) return false;
    floating[floating_count++] = value;
    return true;
  }
  bool add(const std::string& text) {
    texts.push_back(std::make_unique<char[]>(text.size() + 1));
    memcpy(texts.back().get(), text.c_str(), text.size() + 1);
    return add(reinterpret_cast<long>(texts.back().get()));
  }
};

std::string textFrom(Input& input) {
  const size_t times = input.byte() + size_t{1};
  const std::string once = input.text();
  std::string text;
  for (size_t i = 0; i < times && text.size() < 3000; ++i) text += once;
  return text;
}

// The texts of "%ls". The second one has no character of any locale.
const wchar_t* wideTextFrom(Input& input) {
  static constexpr wchar_t kTexts[][8] = {
      L"wide", {L'w', static_cast<wchar_t>(0x7FFFFFFF), 0}, L""};
  return kTexts[input.byte() % 3];
}

// Reads a format as the C library does and makes an argument for each conversion.
class FormatReader {
 public:
  FormatReader(const std::string& format, Input& input) : at_(format.c_str()), input_(input) {}

  // Returns nullopt if it has a conversion of another kind, or too many.
  std::optional<Arguments> arguments() {
    for (; *at_ != '\0'; ++at_) {
      if (*at_ != '%') continue;
      ++at_;
      if (!takeConversion()) return std::nullopt;
      if (*at_ == '\0') break;
    }
    return std::move(arguments_);
  }

 private:
  bool takeConversion() {
    at_ += strspn(at_, "-+ #0'");
    if (!takeNumber()) return false;
    if (*at_ == '.') {
      ++at_;
      if (!takeNumber()) return false;
    }
    const size_t modifiers = strspn(at_, "hlqjzt");
    const std::string modifier(at_, modifiers);
    at_ += modifiers;
    if (*at_ == '\0') return true;
    const bool has_modifier = !modifier.empty();
    const bool is_known = modifier == "hh" || modifier == "h" || modifier == "l" ||
                          modifier == "ll" || modifier == "q" || modifier == "j" ||
                          modifier == "z" || modifier == "t";
    if (has_modifier && !is_known) return false;
    if (strchr("diouxX", *at_) != nullptr) return arguments_.add(input_.number<long>());
    if (strchr("eEfFgGaA", *at_) != nullptr) {
      return (!has_modifier || modifier == "l") && arguments_.add(input_.number<double>());
    }
    if (*at_ == 'c') {
      return (!has_modifier || modifier == "l") && arguments_.add(long{input_.byte()});
    }
    if (*at_ == 's' && modifier == "l") {
      return arguments_.add(reinterpret_cast<long>(wideTextFrom(input_)));
    }
    if (has_modifier) return false;
    if (*at_ == 's') return arguments_.add(textFrom(input_));
    if (*at_ == 'p') return arguments_.add(input_.number<long>());
    return *at_ == '%';
  }

  bool takeNumber() {
    if (*at_ == '*') {
      ++at_;
      return arguments_.add(long{input_.number<int8_t>()} * 8);
    }
    int number = 0;
    for (; *at_ >= '0' && *at_ <= '9'; ++at_) {
      number = number * 10 + (*at_ - '0');
      if (number > kMaxWidth) return false;
    }
    return true;
  }

  const char* at_;
  Input& input_;
  Arguments arguments_;
};

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

int safer(int size, char* dst, const char* format, ...) {
  va_list list;
  va_start(list, format);
  const int result = safer_vsprintf(size, dst, format, list);
  va_end(list);
  return result;
}

int printed(char** out, const char* format, ...) {
  va_list list;
  va_start(list, format);
  const int result = vasprintf(out, format, list);
  va_end(list);
  return result;
}

#pragma GCC diagnostic pop

template <typename Call>
int withArguments(const Arguments& arguments, Call call) {
  return [&]<size_t... Floating, size_t... Whole>(std::index_sequence<Floating...>,
                                                  std::index_sequence<Whole...>) {
    return call(arguments.floating[Floating]..., arguments.whole[Whole]...);
  }
  (std::make_index_sequence<kMaxFloating>(), std::make_index_sequence<kMaxWhole>());
}

// The text, or nullopt if it cannot be printed.
std::optional<std::string> expectedText(const std::string& format, const Arguments& arguments) {
  char* text = nullptr;
  const int length = withArguments(
      arguments, [&](auto... values) { return printed(&text, format.c_str(), values...); });
  if (length < 0) return std::nullopt;
  std::string expected(text, static_cast<size_t>(length));
  free(text);
  return expected;
}

void expectRefusal(int code, int size, const char* format) {
  std::vector<char> dst(1000, kUntouched);
  expectSame("the result", safer(size, dst.data(), format), code);
  expectSame("the buffer of a refused call", {dst.data(), dst.size()},
             std::string(dst.size(), kUntouched));
}

}  // namespace

// The sanitizer's own reading of formats fails at some that end within a conversion.
extern "C" __attribute__((visibility("default"))) const char* __asan_default_options() {
  return "check_printf=0";
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size_of_data) {
  Input input(data, size_of_data);
  const uint8_t kind = input.byte();
  int size = input.number<int16_t>();
  const std::string format = input.text();

  if (kind == 1) {
    expectSame("without a buffer", safer(size, nullptr, format.c_str()), 1);
    expectRefusal(size < 1 ? 2 : 3, size, nullptr);
    return 0;
  }
  if (size < 1) {
    expectRefusal(2, size, format.c_str());
    return 0;
  }
  const Bounded model = bounded(format, size);
  if (model.code != 0) {
    expectRefusal(model.code, size, format.c_str());
    return 0;
  }
  // -1: not into the corpus.
  const std::optional<Arguments> arguments = FormatReader(model.format, input).arguments();
  if (!arguments) return -1;
  const std::optional<std::string> text = expectedText(model.format, *arguments);
  if (text && text->size() > kLargestText) return -1;
  // Often about as large as the text.
  if (kind == 2 && text && text->size() + 2 > format.size()) {
    size = static_cast<int>(text->size()) + 2 - size % 4;
    if (size < 1 || static_cast<size_t>(size) <= format.size()) return -1;
  }

  // Room for the whole text, as the caller has to provide it.
  const size_t room = text ? text->size() + 1 : kLargestText;
  const auto last = static_cast<size_t>(size) - 1;
  std::vector<char> dst(std::max(room, last + 1), kUntouched);
  dst.shrink_to_fit();
  const int result = withArguments(*arguments, [&](auto... values) {
    return safer(size, dst.data(), format.c_str(), values...);
  });

  if (!text) {
    expectSame("the result for a text that cannot be printed", result, 8);
    return 0;
  }
  std::string expected(dst.size(), kUntouched);
  expected[last] = '\0';
  expected.replace(0, text->size() + 1, *text + '\0');
  expectSame("the buffer", {dst.data(), dst.size()}, expected);
  expectSame("the result", result, expected[last] == '\0' ? 0 : 9);
  return 0;
}
