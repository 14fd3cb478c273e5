// The dn commands: distinguished names.
#include <stdio.h>

#include <iostream>
#include <memory>

#include "command.h"

namespace names {
namespace {

struct Options {
  std::optional<std::string> name;
  std::optional<std::string> other;
};

// The lines of standard input, without their line feeds.
std::vector<std::string> linesOfInput() {
  std::vector<std::string> lines;
  for (std::string line; std::getline(std::cin, line);) {
    // The library would see only what stands before it.
    if (line.find('\0') != std::string::npos) {
      throw Usage("a name has a null character");
    }
    lines.push_back(line);
  }
  // The stream takes a failed read of what it stands on for the end.
  if (std::cin.bad() || ferror(stdin) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot read standard input");
  }
  return lines;
}

Answer formatted(std::string name) {
  if (name.empty()) throw Usage("a name is empty");
  return {{"name", name}, {"formatted", take(formatDn(name.data()))}};
}

Answer format(Options& options) {
  if (options.name) return formatted(*options.name);
  Answer list = Answer::array();
  for (const std::string& name : linesOfInput()) list.push_back(formatted(name));
  return list;
}

Answer compare(Options& options) {
  if (!options.name) {
    const std::vector<std::string> names = linesOfInput();
    if (names.size() != 2) {
      throw Usage("two names are compared, not " + std::to_string(names.size()));
    }
    options.name = names[0];
    options.other = names[1];
  }
  if (!options.other) throw Usage("B is missing");
  return {{"a", *options.name},
          {"b", *options.other},
          {"equal", compareDns(options.name->data(), options.other->data())}};
}

}  // namespace

void addCommands(Tool& tool) {
  Command& family = tool.family("dn", "Distinguished names");
  const auto options = std::make_shared<Options>();
  const auto bound = [&options](Answer (*action)(Options&)) {
    return [options, action] { return action(*options); };
  };
  Command& formatting = tool.command(
      family, "format",
      "Show a name in its canonical spelling; without DN, those of the lines of standard\n"
      "input",
      bound(format));
  tool.optionalText(formatting, "DN", options->name, "The name");
  Command& comparison = tool.question(
      family, "compare",
      "Ask whether two names are the same; without A and B, those of the two lines of\n"
      "standard input",
      bound(compare));
  tool.optionalText(comparison, "A", options->name, "A name");
  tool.optionalText(comparison, "B", options->other, "Another");
}

}  // namespace names
