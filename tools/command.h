// What the command families share: how a command is added, how it answers and how it fails.
#pragma once

#include <osutils.h>
#include <stdlib.h>

#include <CLI/CLI.hpp>
#include <charconv>
#include <functional>
#include <limits>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

// An object, or a list of objects with the same keys. It is printed as it is for scripts, and as a table
// with the keys as its headings for people, so that both always say the same. Or a text of whole lines.
using Answer = nlohmann::ordered_json;

using Command = CLI::App;
using Option = CLI::Option;

// The exit statuses.
constexpr int kSuccess = 0;  // or yes
constexpr int kNo = 1;
constexpr int kWrongUsage = 2;
constexpr int kFailure = 3;

// All commands: what they are called, what they take and what they do; and what was typed.
//
// CLI11 keeps the names, the descriptions and the help. It never sees what was typed: some versions of it split
// "[a,b]", or take a text for an option.
class Tool {
 public:
  Tool();
  Tool(const Tool&) = delete;
  Tool& operator=(const Tool&) = delete;

  // A family of commands.
  Command& family(const char* name, const char* description);

  // A text that a command must be given.
  struct Argument {
    const char* name;
    std::string* value;
    const char* description;
  };

  // Adds a command to a family, or to all(). `run` is called after all arguments were understood; nothing
  // is printed before it has returned, but complaints.
  Command& command(Command& family, const char* name, const std::string& description,
                   const std::function<Answer()>& run, const std::vector<Argument>& arguments = {});
  // The same for a yes-or-no question: each object of its answer ends in a boolean. A "no" is an answer
  // and no failure, but has an exit status of its own, so that a script that asks before it acts stops.
  Command& question(Command& family, const char* name, const std::string& description,
                    const std::function<Answer()>& run,
                    const std::vector<Argument>& arguments = {});
  // The same for a command that changes something. With --dry-run, `run` is called with true, changes
  // nothing, and answers what would change.
  Command& change(Command& family, const char* name, const std::string& description,
                  const std::function<Answer(bool dry_run)>& run,
                  const std::vector<Argument>& arguments = {});

  // What else a command takes: options, and texts after its arguments.
  Option& option(Command& command, const char* name, const char* type,
                 std::optional<std::string>& value, const std::string& description);
  Option& flag(Command& command, const char* name, bool& value, const char* description);
  void optionalArgument(Command& command, const char* name, std::optional<std::string>& value,
                        const std::string& description);
  void arguments(Command& command, const char* name, std::vector<std::string>& values,
                 const char* description);  // all that are left, at least one

  Command& all() { return app_; }

  // Does what was typed, the name of the program excepted, and returns the exit status.
  int run(const std::vector<std::string>& words);

  // A line on standard error while the command goes on. The exit status will be that of a failure.
  void reportError(const std::string& what);
  // The same without an effect on the exit status.
  void report(const std::string& what) const;

 private:
  using Word = std::vector<std::string>::const_iterator;
  using Store = std::function<void(const std::string&)>;
  struct Text {
    std::string name;
    bool required;
    bool takes_all;
    Store store;
  };

  void addCommonOptions(Command& command);
  void addText(Command& command, const Text& text, const std::string& description);
  std::optional<std::string> parse(const std::vector<std::string>& words);
  std::optional<std::string> parseOption(Word& word, Word end);
  void parseTexts(const std::vector<std::string>& typed);
  void describe(const std::string& name);
  void requireFittingOptions() const;

  CLI::App app_;
  std::map<const Option*, Store> options_;
  std::map<const Option*, bool*> flags_;
  std::map<const Command*, std::vector<Text>> texts_;
  std::map<const Command*, std::function<Answer()>> actions_;
  std::set<const Command*> questions_;
  std::set<const Command*> changes_;

  const Command* help_ = nullptr;
  Command* described_ = &app_;
  Command* selected_ = &app_;  // as far as the words were understood
  std::set<const Option*> given_options_;
  bool dry_run_ = false;
  bool json_ = false;
  bool verbose_ = false;
  std::optional<std::string> trace_directory_;
  bool has_errors_ = false;
};

// The one line that a failed command leaves on standard error, less the command's name.
class Failure : public std::runtime_error {
 public:
  // For functions that answer a result code: "no such object (32): what".
  Failure(int code, const std::string& what);
  // For functions that answer only yes or no, or -1: what failed, and what checkFilePerms answers for
  // the file that was asked about, or an operations error when it finds nothing wrong with that.
  Failure(const std::string& what, const std::string& path);

  // A parameter error is wrong usage, whoever found it.
  int exitStatus() const { return status_; }

 private:
  int status_;
};

// Arguments that the command does not take.
class Usage : public Failure {
 public:
  explicit Usage(const std::string& what) : Failure(OSUTILS_PARAM_ERROR, what) {}
};

// The answer as JSON, and as a table.
std::string jsonOf(const Answer& answer);
std::string tableOf(const Answer& answer);

// Arguments and files may hold anything; a line must stay one line and a terminal must not obey it.
// Control characters become "?", but for those in `kept`.
std::string printable(std::string_view text, std::string_view kept = "");

// A line, or the lines of a text, on standard error, beside the answer.
void printNotice(const std::string& line);
void printText(const std::string& text);

// From now on the library's debug messages are printed on standard error.
void startVerbosity();

// What a command runs: the action, with the options that the command was given.
template <typename Options>
std::function<Answer()> bound(const std::shared_ptr<Options>& options, Answer (*action)(Options&)) {
  return [options, action] { return action(*options); };
}
template <typename Options>
std::function<Answer(bool)> bound(const std::shared_ptr<Options>& options,
                                  Answer (*action)(Options&, bool dry_run)) {
  return [options, action](bool dry_run) { return action(*options, dry_run); };
}

std::string inQuotes(const std::string& text);

// True for what a shell takes for one word, and that word for no option, wherever it stands unquoted.
bool isShellWord(std::string text);
Usage notShellWord(const char* what, const std::string& text);

// The text as a number to the base; wrong usage when it is none or out of range. `kind` is "a whole
// number" or the like.
template <typename Number>
Number numberFrom(const std::string& text, const char* argument, const char* kind, int base = 10,
                  Number least = std::numeric_limits<Number>::min(),
                  Number most = std::numeric_limits<Number>::max()) {
  Number value = 0;
  const char* const last = text.data() + text.size();
  const auto [end, error] = std::from_chars(text.data(), last, value, base);
  if (error != std::errc() || end != last || value < least || value > most) {
    throw Usage(std::string(argument) + " is not " + kind + ": " + inQuotes(text));
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

// Fail when there is no such account.
void requireUser(const std::string& name);
void requireGroup(const std::string& name);

// One function for each source of commands. Each source has a namespace, because they are compiled as one.
namespace services {
void addCommands(Tool& tool);
}
namespace inittab {
void addCommands(Tool& tool);
}
namespace paths {
void addCommands(Tool& tool);
}
namespace files {
void addCommands(Tool& tool);
}
namespace accounts {
void addCommands(Tool& tool);
}
namespace checks {
void addCommands(Tool& tool);
}
namespace processes {
void addCommands(Tool& tool);
}
namespace network {
void addCommands(Tool& tool);
}
namespace names {
void addCommands(Tool& tool);
}
