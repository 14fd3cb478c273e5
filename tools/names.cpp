// The dn commands: distinguished names.
#include <stdio.h>

#include <algorithm>
#include <iostream>
#include <memory>
#include <string_view>

#include "command.h"

namespace names {
namespace {

constexpr const char* kLimitations =
    "\nThe library does not decode escapes of two hexadecimal digits, sort\n"
    "values that are joined by \"+\", know synonyms of attributes, or ignore\n"
    "the case of non-ASCII letters";

struct Options {
  std::optional<std::string> name;
  std::optional<std::string> other;
  bool quiet = false;
};

bool isHexDigit(char c) {
  return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

// As in "a\\2Cb". An escaped backslash does not begin an escape.
bool hasHexEscape(std::string_view name) {
  for (size_t at = 0; at + 2 < name.size(); ++at) {
    if (name[at] != '\\') continue;
    if (isHexDigit(name[at + 1]) && isHexDigit(name[at + 2])) return true;
    ++at;
  }
  return false;
}

class Names {
 public:
  Names(Tool& tool, Options& options) : tool_(tool), options_(options) {}

  Answer format() {
    if (options_.name) return formatted(*options_.name);
    Answer list = Answer::array();
    for (const std::string& name : linesOfInput()) list.push_back(formatted(name));
    return list;
  }

  Answer compare() {
    if (!options_.name) {
      const std::vector<std::string> names = linesOfInput();
      if (names.size() != 2) {
        throw Usage("two names are expected, not " + std::to_string(names.size()));
      }
      options_.name = names[0];
      options_.other = names[1];
    }
    if (!options_.other) throw Usage("B is missing");
    warnAboutEscapes(*options_.name);
    warnAboutEscapes(*options_.other);
    return {{"a", *options_.name},
            {"b", *options_.other},
            {"equal", compareDns(options_.name->data(), options_.other->data())}};
  }

 private:
  Answer formatted(const std::string& name) {
    if (name.empty()) throw Usage("the name is empty");
    warnAboutEscapes(name);
    return {{"name", name}, {"formatted", orNoMemory(osutils::formatDn(name))}};
  }

  void warnAboutEscapes(const std::string& name) {
    if (options_.quiet || !hasHexEscape(name)) return;
    tool_.report("escapes of two hexadecimal digits are not decoded: " + inQuotes(name));
  }

  // The valid lines of standard input, without their newlines.
  std::vector<std::string> linesOfInput() {
    std::vector<std::string> lines;
    size_t number = 0;
    for (std::string line; std::getline(std::cin, line);) {
      const std::string place = "line " + std::to_string(++number) + " of standard input ";
      if (line.find('\0') != std::string::npos) {  // the library would stop there
        tool_.reportError(place + "has a null character");
      } else if (line.find_first_not_of(" \t\r") == std::string::npos) {
        tool_.reportError(place + "is blank");
      } else {
        lines.push_back(line);
      }
    }
    // std::cin reports a read error of the underlying stdin as the end.
    if (std::cin.bad() || ferror(stdin) != 0) {
      throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot read standard input");
    }
    return lines;
  }

  Tool& tool_;
  Options& options_;
};

}  // namespace

void addCommands(Tool& tool) {
  Command& family = tool.family("dn", "Format and compare distinguished names");
  const auto options = std::make_shared<Options>();
  const auto bound = [&](Answer (Names::*action)()) {
    return [&tool, options, action] { return (Names(tool, *options).*action)(); };
  };
  const auto takeQuiet = [&](Command& command) {
    tool.flag(command, "--quiet", options->quiet,
              "Do not warn about escapes of two hexadecimal digits");
  };
  Command& formatting = tool.command(
      family, "format",
      std::string("Show a name in canonical form. Without DN, show each line of standard\n"
                  "input in that form.") +
          kLimitations,
      bound(&Names::format));
  takeQuiet(formatting);
  tool.optionalArgument(formatting, "DN", options->name, "The name");
  Command& comparison = tool.question(
      family, "compare",
      std::string("Ask whether two names are equal. Without A and B, compare the two\n"
                  "lines of standard input.") +
          kLimitations,
      bound(&Names::compare));
  takeQuiet(comparison);
  tool.optionalArgument(comparison, "A", options->name, "The first name");
  tool.optionalArgument(comparison, "B", options->other, "The second name");
}

}  // namespace names
