// What the command families share: how a command is added, how it answers and how it fails.
#pragma once

#include <osutils.h>
#include <stdlib.h>

#include <CLI/CLI.hpp>
#include <charconv>
#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
#include <stdexcept>
#include <string>

// An object, or a list of objects with the same keys. It is printed as it is for scripts, and as a table
// with the keys as its headings for people, so that both always say the same.
using Answer = nlohmann::ordered_json;

// The command that the arguments ask for, and the options that every command has.
struct Chosen {
  std::function<Answer()> run;
  bool is_question = false;
  bool json = false;
  std::optional<std::string> trace_directory;
};

// Adds a command to a family. `run` is called after all arguments were understood; nothing is printed
// before it has returned.
CLI::App& addCommand(CLI::App& family, Chosen& chosen, const char* name, const char* description,
                     const std::function<Answer()>& run);

// The same for a yes-or-no question: each object of its answer ends in a boolean. A "no" is an answer
// and no failure, but the exit status is 1 for it, so that a script that asks before it acts stops.
CLI::App& addQuestion(CLI::App& family, Chosen& chosen, const char* name, const char* description,
                      const std::function<Answer()>& run);

// The one line that a failed command leaves on standard error, less the command's name.
class Failure : public std::runtime_error {
 public:
  // For functions that answer a result code: "no such object (32): what".
  Failure(int code, const std::string& what);
  // For functions that answer only yes or no, or -1: what failed, and what checkFilePerms answers for
  // the file that was asked about, or an operations error when it finds nothing wrong with that.
  Failure(const std::string& what, const std::string& path);
};

std::string inQuotes(const std::string& text);

// True for what a shell takes for one word, and that word for no option, wherever it stands unquoted.
bool isShellWord(std::string text);

// The text as a number to the base; a Failure when it is none or does not fit. `kind` is "a whole
// number" or the like.
template <typename Number>
Number numberFrom(const std::string& text, const char* argument, const char* kind, int base = 10) {
  Number value = 0;
  const char* const last = text.data() + text.size();
  const auto [end, error] = std::from_chars(text.data(), last, value, base);
  if (error != std::errc() || end != last) {
    throw Failure(OSUTILS_PARAM_ERROR,
                  std::string(argument) + " is not " + kind + ": " + inQuotes(text));
  }
  return value;
}

struct FreeDeleter {
  void operator()(void* memory) const noexcept { free(memory); }
};

// The contents of a new string of the library's, which is freed. Null is taken for want of memory:
// callers that know another reason ask for it first.
std::string take(char* text);

// Refuses a pipe or a device. A missing file and one that permissions hide are left to the call that
// needs them.
void requireRegularFile(const std::string& path);

// One function for each source of commands. Each source has a namespace, because they are compiled as one.
namespace services {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace inittab {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace paths {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace files {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace accounts {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace checks {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace processes {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace network {
void addCommands(CLI::App& tool, Chosen& chosen);
}
namespace names {
void addCommands(CLI::App& tool, Chosen& chosen);
}
