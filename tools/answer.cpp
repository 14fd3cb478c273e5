// How an answer is printed.
#include <locale.h>
#include <stdio.h>
#include <wchar.h>

#include <algorithm>
#include <string_view>

#include "command.h"

namespace {

// Sets a UTF-8 locale for this thread until the end of the scope. Only for measuring: the library's
// results depend on the locale.
class ScopedUtf8 {
 public:
  ScopedUtf8() : utf8_(newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr)) {
    if (utf8_ != nullptr) previous_ = uselocale(utf8_);
  }
  ~ScopedUtf8() {
    if (utf8_ == nullptr) return;
    (void)uselocale(previous_);
    freelocale(utf8_);
  }
  ScopedUtf8(const ScopedUtf8&) = delete;
  ScopedUtf8& operator=(const ScopedUtf8&) = delete;

 private:
  locale_t utf8_;
  locale_t previous_ = nullptr;
};

// Calls `use` with each character and its bytes, or with WEOF and an invalid byte.
template <typename Use>
void forEachCharacter(std::string_view text, Use use) {
  const ScopedUtf8 utf8;
  while (!text.empty()) {
    wchar_t character = L'\0';
    mbstate_t state = {};
    size_t bytes = mbrtowc(&character, text.data(), text.size(), &state);
    const bool is_character = bytes <= text.size();
    if (!is_character || bytes == 0) bytes = 1;  // invalid, or the null character
    use(is_character ? static_cast<wint_t>(character) : WEOF, text.substr(0, bytes));
    text.remove_prefix(bytes);
  }
}

bool isControl(wint_t character) {
  return character < 0x20 || (character >= 0x7f && character < 0xa0);
}

// The columns that a terminal needs. An invalid byte or an unknown character takes one.
size_t widthOf(const std::string& text) {
  size_t columns = 0;
  forEachCharacter(text, [&](wint_t character, std::string_view) {
    const int width = character == WEOF ? -1 : wcwidth(static_cast<wchar_t>(character));
    columns += width < 0 ? 1 : static_cast<size_t>(width);
  });
  return columns;
}

struct Cell {
  std::string text;
  size_t width;
};

Cell cellOf(const std::string& text) { return {text, widthOf(text)}; }

}  // namespace

std::string printable(std::string_view text, std::string_view kept) {
  const auto is_plain = [](char c) { return c >= 0x20 && c < 0x7f; };
  if (std::all_of(text.begin(), text.end(), is_plain)) return std::string(text);  // takes no locale
  std::string printed;
  forEachCharacter(text, [&](wint_t character, std::string_view bytes) {
    if (isControl(character) && kept.find(bytes) == std::string_view::npos) {
      printed += '?';
    } else {
      printed += bytes;
    }
  });
  return printed;
}

void printNotice(const std::string& line) {
  (void)fputs(("osutils: " + printable(line) + '\n').c_str(), stderr);
}

void printText(const std::string& text) { (void)fputs(printable(text, "\n\t").c_str(), stderr); }

std::string jsonOf(const Answer& answer) {
  // JSON cannot hold invalid UTF-8: it becomes U+FFFD
  return answer.dump(-1, ' ', false, Answer::error_handler_t::replace) + '\n';
}

std::string tableOf(const Answer& answer) {
  if (answer.is_string()) return printable(answer.get<std::string>(), "\n\t");
  const Answer list = answer.is_array() ? answer : Answer::array({answer});
  if (list.empty()) return "";

  std::vector<std::vector<Cell>> rows(1);
  for (const auto& heading : list.front().items()) {
    std::string text = heading.key();
    std::transform(text.begin(), text.end(), text.begin(), [](char c) {
      return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
    });
    rows.front().push_back(cellOf(text));
  }
  for (const Answer& object : list) {
    rows.emplace_back();
    for (const Answer& value : object) {
      rows.back().push_back(
          cellOf(value.is_string() ? printable(value.get<std::string>()) : value.dump()));
    }
  }

  std::vector<size_t> widths(rows.front().size());
  for (const auto& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].width);
  }
  std::string text;
  for (const auto& row : rows) {
    for (size_t i = 0; i + 1 < row.size(); ++i) {
      text += row[i].text + std::string(widths[i] - row[i].width + 2, ' ');
    }
    text += row.back().text + '\n';
  }
  return text;
}
