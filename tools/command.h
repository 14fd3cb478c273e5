// What the families of commands share: adding commands, answers and failures.
#pragma once

#include <grp.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/types.h>

#include <CLI/CLI.hpp>
#include <charconv>
#include <functional>
#include <limits>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <osutils.hpp>
#include <set>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

// What a command prints: an object, a list of objects with the same keys, or a text of whole lines.
// Objects are printed as JSON or as a table with the keys as headings. Null if the command has
// printed its answer itself.
using Answer = nlohmann::ordered_json;

using Command = CLI::App;
using Option = CLI::Option;

// Exit statuses.
constexpr int kSuccess = 0;  // or yes
constexpr int kNo = 1;
constexpr int kWrongUsage = 2;
constexpr int kFailure = 3;

// What an argument or the value of an option is, for completion.
struct Kind {
  const char* name = "text";
  std::span<const char* const> choices = {};
};
constexpr Kind kFile = {"file"};
constexpr Kind kDirectory = {"directory"};
constexpr Kind kUser = {"user"};
constexpr Kind kGroup = {"group"};
constexpr Kind kService = {"service"};
constexpr Kind kCommand = {"command"};
constexpr Kind oneOf(std::span<const char* const> choices) { return {"choice", choices}; }

// All commands, and the parsed command line.
//
// CLI11 only keeps names and descriptions and formats the help. It does not parse the command line:
// some versions split "[a,b]", or take an argument for an option.
class Tool {
 public:
  Tool();
  Tool(const Tool&) = delete;
  Tool& operator=(const Tool&) = delete;

  // A family of commands.
  Command& family(const char* name, const char* description);

  // A required positional argument.
  struct Argument {
    const char* name;
    std::string* value;
    const char* description;
    Kind kind = {};
  };

  // Adds a command to a family, or to all(). `run` is called after the whole command line is
  // parsed, and its answer is printed.
  Command& command(Command& family, const char* name, const std::string& description,
                   const std::function<Answer()>& run, const std::vector<Argument>& arguments = {});
  // Adds a yes-or-no question. Each object of its answer ends with a boolean. The exit status of
  // "no" is not 0, so that a script can test it.
  Command& question(Command& family, const char* name, const std::string& description,
                    const std::function<Answer()>& run,
                    const std::vector<Argument>& arguments = {});
  // Adds a command that changes something. With --dry-run, `run` gets true: it changes nothing, and
  // its answer is what would change.
  Command& change(Command& family, const char* name, const std::string& description,
                  const std::function<Answer(bool dry_run)>& run,
                  const std::vector<Argument>& arguments = {});

  // Options, and positional arguments after the required ones.
  Option& option(Command& command, const char* name, const char* type,
                 std::optional<std::string>& value, const std::string& description, Kind kind = {});
  Option& flag(Command& command, const char* name, bool& value, const char* description);
  void optionalArgument(Command& command, const char* name, std::optional<std::string>& value,
                        const std::string& description);
  void arguments(Command& command, const char* name, std::vector<std::string>& values,
                 const char* description, Kind kind = {});  // all remaining words, at least one
  // The same, but options may be among them.
  void argumentsAmongOptions(Command& command, const char* name, std::vector<std::string>& values,
                             const char* description, Kind kind = {});

  Command& all() { return app_; }

  bool printsJson() const { return json_; }

  // Runs the command line, without the program name, and returns the exit status.
  int run(const std::vector<std::string>& words);

  // Prints a line on standard error and continues. The exit status will be kFailure.
  void reportError(const std::string& what);
  // The same, without an effect on the exit status.
  void report(const std::string& what) const;

 private:
  using Word = std::vector<std::string>::const_iterator;
  using Store = std::function<void(const std::string&)>;
  struct Text {
    std::string name;
    bool required;
    bool takes_all;
    Store store;
    const Option* option = nullptr;
  };

  void addCommonOptions(Command& command);
  void addText(Command& command, Text text, const std::string& description, Kind kind = {});
  std::optional<std::string> parse(const std::vector<std::string>& words);
  std::optional<std::string> parseOption(Word& word, Word end);
  void parseTexts(const std::vector<std::string>& typed);
  void describe(const std::string& name);
  Answer descriptionOf(const Command& command) const;
  Answer descriptionOf(const Option& option) const;
  void requireFittingOptions() const;

  CLI::App app_;
  std::map<const Option*, Store> options_;
  std::map<const Option*, bool*> flags_;
  std::map<const Option*, Kind> kinds_;
  std::map<const Command*, std::vector<Text>> texts_;
  std::map<const Command*, std::function<Answer()>> actions_;
  std::set<const Command*> questions_;
  std::set<const Command*> changes_;
  std::set<const Command*> mixed_;  // options may be among the arguments

  const Command* help_ = nullptr;
  Command* described_ = &app_;
  Command* selected_ = &app_;  // by the words that are parsed so far
  std::set<const Option*> given_options_;
  bool dry_run_ = false;
  bool json_ = false;
  bool verbose_ = false;
  std::optional<std::string> trace_directory_;
  bool has_errors_ = false;
};

// The line that a failed command prints on standard error, without the command's name.
class Failure : public std::runtime_error {
 public:
  // For functions that return a result code: "no such object (32): what".
  Failure(int code, const std::string& what);
  // For functions that return only true or false, or -1: adds what checkFilePerms returns for the
  // file, or an operations error if it returns success.
  Failure(const std::string& what, const std::string& path);

  // A parameter error is wrong usage, also when the library returns it.
  int exitStatus() const { return status_; }

 private:
  int status_;
};

// Wrong usage.
class Usage : public Failure {
 public:
  explicit Usage(const std::string& what) : Failure(OSUTILS_PARAM_ERROR, what) {}
};

std::string jsonOf(const Answer& answer);
std::string tableOf(const Answer& answer);

// Replaces control characters by "?", except those in `kept`: arguments and the contents of files
// must not break lines or control the terminal.
std::string printable(std::string_view text, std::string_view kept = "");

// Print a line, or a text of lines, on standard error.
void printNotice(const std::string& line);
void printText(const std::string& text);

// Prints the library's debug messages on standard error from now on.
void startVerbosity();

// Binds an action to the options of its family.
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

// True if a shell takes the unquoted text for one word, and a program does not take it for an
// option.
bool isShellWord(std::string text);
Usage notShellWord(const char* what, const std::string& text);

// Converts the text; wrong usage if it is not a number or out of range. `kind` is "a whole number"
// or the like.
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

// What the library returned. Nothing means no memory: callers check for other causes first.
std::string orNoMemory(std::optional<std::string> text);
// The same for a path below the installation root.
std::string installedPath(std::optional<std::string> path);

// Refuses anything but a regular file. The call that uses the file reports one that is missing or
// hidden.
void requireRegularFile(const std::string& path);

// Whether the account exists. Unlike the library, these and the next ones fail if the look-up fails.
bool userExists(const std::string& name);
bool groupExists(const std::string& name);
// The C library's entry of the account, or null.
const passwd* findUser(const std::string& name);
const group* findGroup(const std::string& name);
const group* findGroup(gid_t number);

// Fail if the account does not exist.
void requireUser(const std::string& name);
void requireGroup(const std::string& name);

// One function for each source of commands. Namespaces keep the sources apart, which are compiled
// as one.
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
