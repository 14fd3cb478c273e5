// Parsing of the command line, and what the families of commands share.
#include "command.h"

#include <errno.h>
#include <ldtr.h>
#include <stdio.h>
#include <string.h>

#include <algorithm>
#include <memory>
#include <new>
#include <utility>

namespace {

constexpr char kNameAndVersion[] = "osutils " OSUTILS_VERSION;

std::string resultText(int code) {
  return osutils::errorCode(code).message() + " (" + std::to_string(code) + ")";
}

std::string withReason(const std::string& what, const std::string& path) {
  const int code = checkFilePerms(path.c_str());
  if (code == OSUTILS_SUCCESS) return resultText(OSUTILS_OPERATIONS_ERROR) + ": " + what;
  return what + "; checkFilePerms returns " + resultText(code) + " for " + path;
}

// The Levenshtein distance.
size_t editDistance(const std::string& from, const std::string& to) {
  std::vector<size_t> row(to.size() + 1);
  for (size_t i = 0; i < row.size(); ++i) row[i] = i;
  for (size_t i = 0; i < from.size(); ++i) {
    size_t diagonal = row[0]++;
    for (size_t j = 0; j < to.size(); ++j) {
      const size_t changed = diagonal + (from[i] == to[j] ? 0 : 1);
      diagonal = row[j + 1];
      row[j + 1] = std::min({changed, row[j] + 1, diagonal + 1});
    }
  }
  return row.back();
}

// " (nearest: ...)" with the nearest word by edit distance, then by the longest common prefix. Empty if
// the distance is more than a third of the word.
std::string nearestTo(const std::string& word, const std::vector<std::string>& known,
                      const char* kind = "") {
  const auto rank = [&word](const std::string& other) {
    const auto differing = std::mismatch(word.begin(), word.end(), other.begin(), other.end());
    return std::pair(editDistance(word, other), word.end() - differing.first);
  };
  const std::string& nearest = *std::min_element(
      known.begin(), known.end(),
      [&rank](const std::string& a, const std::string& b) { return rank(a) < rank(b); });
  if (rank(nearest).first > word.size() / 3) return "";
  return std::string(" (nearest") + kind + ": " + inQuotes(nearest) + ")";
}

std::string inOneLine(std::string text) {
  std::replace(text.begin(), text.end(), '\n', ' ');
  return text;
}

std::vector<std::string> commandsOf(const Command& family) {
  std::vector<std::string> names;
  for (const Command* const command : family.get_subcommands({})) {
    names.push_back(command->get_name());
  }
  return names;
}

bool isFamily(const Command& command) { return !commandsOf(command).empty(); }

Command* commandNamed(Command& family, const std::string& name) {
  for (Command* const command : family.get_subcommands({})) {
    if (command->get_name() == name) return command;
  }
  return nullptr;
}

Usage unknownCommand(const Command& family, const std::string& word) {
  return Usage("unknown command " + inQuotes(word) + nearestTo(word, commandsOf(family)));
}

// As they are typed: "-h", "--help".
std::vector<std::string> namesOf(const Option& option) {
  std::vector<std::string> names;
  for (const std::string& name : option.get_snames()) names.push_back('-' + name);
  for (const std::string& name : option.get_lnames()) names.push_back("--" + name);
  return names;
}

std::string nameOf(const Option& option) { return namesOf(option).back(); }

std::vector<std::string> optionsOf(const Command& command) {
  std::vector<std::string> names;
  for (const Option* const option : command.get_options()) {
    for (const std::string& name : namesOf(*option)) names.push_back(name);
  }
  return names;
}

const Option* optionNamed(const Command& command, const std::string& name) {
  for (const Option* const option : command.get_options()) {
    const std::vector<std::string> names = namesOf(*option);
    if (std::find(names.begin(), names.end(), name) != names.end()) return option;
  }
  return nullptr;
}

// "services delete"; empty for the tool itself.
std::string fullName(const Command& command) {
  if (command.get_parent() == nullptr) return "";
  const std::string family = fullName(*command.get_parent());
  return family + (family.empty() ? "" : " ") + command.get_name();
}

std::string helpOf(const Command& command) {
  std::string prefix;
  if (command.get_parent() != nullptr) {
    const std::string family = fullName(*command.get_parent());
    prefix = family.empty() ? "osutils" : "osutils " + family;
  }
  std::string help = command.help(prefix);
  // A stream that lacks memory drops text without an exception.
  if (command.help(prefix) != help) throw std::bad_alloc();
  return help;
}

bool isNo(const Answer& answer) {
  if (answer.is_array()) return std::any_of(answer.begin(), answer.end(), isNo);
  return !answer.back().get<bool>();
}

void print(const std::string& text) {
  const bool written = fwrite(text.data(), 1, text.size(), stdout) == text.size();
  if (fclose(stdout) != 0 || !written) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  std::string("cannot write to standard output: ") + strerror(errno));
  }
}

void startTracing(const std::string& directory) {
  // an empty TRC_DIR switches tracing off
  if (!directory.empty() && setenv("TRC_DIR", directory.c_str(), 1) == 0 &&
      setenv("TRC_EVENTS", "all", 0) == 0 && ldtr_init() == 0) {
    return;
  }
  // Find the bad setting: the one without which tracing starts.
  std::string reason = "cannot start tracing in " + directory;
  for (const char* const setting : {"TRC_DIR", "TRC_MAX_BYTES", "TRC_MODE", "TRC_EVENTS"}) {
    const char* const value = getenv(setting);
    if (value == nullptr) continue;
    if (strcmp(setting, "TRC_DIR") != 0) {
      reason = std::string("cannot start tracing: ") + setting + " is " + inQuotes(value);
    }
    (void)unsetenv(setting);
    if (ldtr_init() == 0) break;
  }
  throw Failure(OSUTILS_OPERATIONS_ERROR, reason);
}

Failure failedLookUp(const std::string& what) {
  return Failure(OSUTILS_OPERATIONS_ERROR, "cannot look up " + what);
}

// The entry that a function like getpwnam returns. For an account that does not exist, the functions
// set errno to 0 or to any of many values, but not to these.
template <typename Entry, typename Key>
const Entry* lookedUp(Entry* (*look_up)(Key), Key key, const std::string& what) {
  errno = 0;
  const Entry* const entry = look_up(key);
  if (entry != nullptr) return entry;
  for (const int error : {EINTR, EIO, EMFILE, ENFILE, ENOMEM, ERANGE}) {
    if (errno == error) throw failedLookUp(what + ": " + strerror(error));
  }
  return nullptr;
}

}  // namespace

Failure::Failure(int code, const std::string& what)
    : std::runtime_error(resultText(code) + ": " + what),
      status_(code == OSUTILS_PARAM_ERROR ? kWrongUsage : kFailure) {}

Failure::Failure(const std::string& what, const std::string& path)
    : std::runtime_error(withReason(what, path)), status_(kFailure) {}

Tool::Tool() : app_("Operating-system utilities for directory server tools", "osutils") {
  app_.set_version_flag("--version", kNameAndVersion);
  app_.require_subcommand(1);
  app_.footer(
      "Options come before a command's other arguments. All words from the first\n"
      "such argument on, or after --, are taken literally; but options of the trace\n"
      "commands may also follow their paths.\n"
      "The exit status is 0 after success and for yes, 1 for no, 2 for wrong usage\n"
      "and 3 after a failure. For 2 and 3, one line on standard error gives the\n"
      "reason.");
  addCommonOptions(app_);
  Command& help = command(app_, "help", "List the commands, or describe one", nullptr);
  addText(help, {"COMMAND", false, true, [this](const std::string& name) { describe(name); }},
          "The command to describe", kCommand);
  help_ = &help;
}

void Tool::addCommonOptions(Command& command) {
  flag(command, "--json", json_, "Print the answer as JSON");
  option(command, "--trace", "DIR", trace_directory_,
         "Record the library's calls in this directory, for babeltrace2", kDirectory);
  flag(command, "--verbose", verbose_, "Print the library's debug messages on standard error");
}

Command& Tool::family(const char* name, const char* description) {
  Command& family = *app_.add_subcommand(name, description);
  family.require_subcommand(1);
  addCommonOptions(family);
  return family;
}

Command& Tool::command(Command& family, const char* name, const std::string& description,
                       const std::function<Answer()>& run, const std::vector<Argument>& arguments) {
  Command& command = *family.add_subcommand(name, description);
  actions_[&command] = run;
  addCommonOptions(command);
  command.footer("The exit status is 0 after success, 2 for wrong usage and 3 after a failure.");
  for (const Argument& argument : arguments) {
    addText(command,
            {argument.name, true, false,
             [value = argument.value](const std::string& text) { *value = text; }},
            argument.description, argument.kind);
  }
  return command;
}

Command& Tool::question(Command& family, const char* name, const std::string& description,
                        const std::function<Answer()>& run,
                        const std::vector<Argument>& arguments) {
  Command& added = command(family, name, description, run, arguments);
  questions_.insert(&added);
  added.footer("The exit status is 0 for yes, 1 for no, 2 for wrong usage and 3 after a failure.");
  return added;
}

Command& Tool::change(Command& family, const char* name, const std::string& description,
                      const std::function<Answer(bool dry_run)>& run,
                      const std::vector<Argument>& arguments) {
  Command& added = command(
      family, name, description, [this, run] { return run(dry_run_); }, arguments);
  changes_.insert(&added);
  flag(added, "--dry-run", dry_run_, "Show what would change without changing it");
  return added;
}

Option& Tool::option(Command& command, const char* name, const char* type,
                     std::optional<std::string>& value, const std::string& description, Kind kind) {
  Option& option = *command.add_option(name, CLI::callback_t(), description)->type_name(type);
  options_[&option] = [name = std::string(name), &value](const std::string& text) {
    if (value) throw Usage(name + " is given twice");
    value = text;
  };
  kinds_[&option] = kind;
  return option;
}

Option& Tool::flag(Command& command, const char* name, bool& value, const char* description) {
  Option& option = *command.add_flag_callback(
      name, [] {}, description);
  flags_[&option] = &value;
  return option;
}

void Tool::addText(Command& command, Text text, const std::string& description, Kind kind) {
  Option* const option = command.add_option(text.name, CLI::callback_t(), description)
                             ->required(text.required)
                             ->type_name("");
  if (text.takes_all) option->expected(1, CLI::detail::expected_max_vector_size);
  kinds_[option] = kind;
  text.option = option;
  texts_[&command].push_back(std::move(text));
}

void Tool::optionalArgument(Command& command, const char* name, std::optional<std::string>& value,
                            const std::string& description) {
  addText(command, {name, false, false, [&value](const std::string& text) { value = text; }},
          description);
}

void Tool::arguments(Command& command, const char* name, std::vector<std::string>& values,
                     const char* description, Kind kind) {
  addText(command,
          {name, true, true, [&values](const std::string& text) { values.push_back(text); }},
          description, kind);
}

void Tool::argumentsAmongOptions(Command& command, const char* name,
                                 std::vector<std::string>& values, const char* description,
                                 Kind kind) {
  arguments(command, name, values, description, kind);
  mixed_.insert(&command);
  command.footer("Options may also follow the arguments.\n" + command.get_footer());
}

int Tool::run(const std::vector<std::string>& words) {
  try {
    if (const std::optional<std::string> text = parse(words)) {
      print(*text);
      return kSuccess;
    }
    if (trace_directory_) startTracing(*trace_directory_);
    if (verbose_) startVerbosity();
    const Answer answer = actions_.at(selected_)();
    try {
      print(answer.is_null() ? "" : json_ ? jsonOf(answer) : tableOf(answer));
    } catch (const Failure& failure) {
      if (!changes_.contains(selected_) || dry_run_) throw;
      report(std::string(failure.what()) + "; the change itself is done");
      return kFailure;
    }
    if (has_errors_) return kFailure;
    return questions_.contains(selected_) && isNo(answer) ? kNo : kSuccess;
  } catch (const Failure& failure) {
    report(failure.what());
    return has_errors_ ? kFailure : failure.exitStatus();
  }
}

// Returns the text to print if the words ask for one, for instance with --help.
std::optional<std::string> Tool::parse(const std::vector<std::string>& words) {
  auto word = words.begin();
  std::vector<std::string> texts;
  while (word != words.end() && *word != "--") {
    if (word->starts_with('-')) {
      if (auto text = parseOption(word, words.end())) return text;
    } else if (Command* const command = commandNamed(*selected_, *word)) {
      selected_ = command;
      ++word;
    } else if (mixed_.contains(selected_)) {
      texts.push_back(*word++);
    } else {
      break;
    }
  }
  if (isFamily(*selected_)) {
    if (word != words.end() && *word != "--") throw unknownCommand(*selected_, *word);
    std::string known;
    for (const std::string& name : commandsOf(*selected_))
      known += (known.empty() ? "" : ", ") + name;
    throw Usage("a command is missing, one of: " + known);
  }
  if (word != words.end() && *word == "--") ++word;
  texts.insert(texts.end(), word, words.end());
  parseTexts(texts);
  if (selected_ == help_) return json_ ? jsonOf(descriptionOf(*described_)) : helpOf(*described_);
  requireFittingOptions();
  return std::nullopt;
}

std::optional<std::string> Tool::parseOption(Word& word, Word end) {
  const size_t equals = word->find('=');
  const std::string name = word->substr(0, equals);
  const Option* const option = optionNamed(*selected_, name);
  if (option == nullptr) {
    const bool takes_texts = texts_.contains(selected_);
    throw Usage("unknown option " + inQuotes(name) + nearestTo(name, optionsOf(*selected_)) +
                (takes_texts ? "; put -- before an argument that begins with \"-\"" : ""));
  }
  given_options_.insert(option);
  const auto with_value = options_.find(option);
  if (with_value == options_.end()) {
    if (equals != std::string::npos) throw Usage(name + " takes no value");
    ++word;
    if (option == selected_->get_help_ptr()) return helpOf(*selected_);
    if (option == app_.get_version_ptr()) return std::string(kNameAndVersion) + '\n';
    *flags_.at(option) = true;
    return std::nullopt;
  }
  std::string value;
  if (equals != std::string::npos) {
    value = word->substr(equals + 1);
  } else if (++word != end) {
    value = *word;
  } else {
    throw Usage(name + " needs a value");
  }
  ++word;
  with_value->second(value);
  return std::nullopt;
}

void Tool::parseTexts(const std::vector<std::string>& typed) {
  size_t at = 0;
  std::string known;
  for (const Text& text : texts_[selected_]) {
    known += ' ' + text.name;
    if (at == typed.size() && text.required) throw Usage(text.name + " is missing");
    const size_t count =
        text.takes_all ? typed.size() - at : std::min<size_t>(typed.size() - at, 1);
    for (size_t i = 0; i < count; ++i) text.store(typed[at++]);
  }
  if (at == typed.size()) return;

  const std::string& unexpected = typed[at];
  std::string hint;
  if (optionNamed(*selected_, unexpected.substr(0, unexpected.find('='))) != nullptr) {
    hint = ": options come before " +
           (known.empty() ? inQuotes("--") : texts_[selected_].front().name);
  } else if (unexpected.starts_with('-')) {
    hint = nearestTo(unexpected, optionsOf(*selected_), " option");
  } else {
    hint = nearestTo(unexpected, commandsOf(*selected_->get_parent()), " command");
  }
  throw Usage("unexpected argument " + inQuotes(unexpected) + hint + "; " +
              inQuotes(fullName(*selected_)) + " takes " +
              (known.empty() ? "only options" : "options, then" + known));
}

// Takes the next word after "help".
void Tool::describe(const std::string& name) {
  Command* const command = commandNamed(*described_, name);
  if (command != nullptr) {
    described_ = command;
  } else if (isFamily(*described_)) {
    throw unknownCommand(*described_, name);
  } else {
    throw Usage("unexpected argument " + inQuotes(name) + ": " + inQuotes(fullName(*described_)) +
                " has no subcommands");
  }
}

Answer Tool::descriptionOf(const Command& command) const {
  Answer answer = {{"name", command.get_name()},
                   {"description", inOneLine(command.get_description())},
                   {"notes", inOneLine(command.get_footer())}};
  answer["options"] = Answer::array();
  for (const Option* const option : command.get_options()) {
    if (!namesOf(*option).empty()) answer["options"].push_back(descriptionOf(*option));
  }
  answer["options_among_arguments"] = mixed_.contains(&command);
  answer["arguments"] = Answer::array();
  const auto texts = texts_.find(&command);
  if (texts != texts_.end()) {
    for (const Text& text : texts->second) {
      Answer argument = {
          {"name", text.name}, {"required", text.required}, {"repeated", text.takes_all}};
      argument.update(descriptionOf(*text.option));
      answer["arguments"].push_back(argument);
    }
  }
  answer["commands"] = Answer::array();
  for (const Command* const subcommand : command.get_subcommands({})) {
    answer["commands"].push_back(descriptionOf(*subcommand));
  }
  return answer;
}

// Of an option, or of what is special about a positional argument.
Answer Tool::descriptionOf(const Option& option) const {
  Answer answer = Answer::object();  // null would be destroyed as a broken object if memory ran out
  const std::vector<std::string> names = namesOf(option);
  const auto kind = kinds_.find(&option);
  if (!names.empty()) {
    answer["names"] = names;
    answer["value"] = kind == kinds_.end() ? Answer() : Answer(option.get_type_name());
  }
  answer["kind"] = kind == kinds_.end() ? Answer() : Answer(kind->second.name);
  answer["choices"] = Answer::array();
  if (kind != kinds_.end()) {
    for (const char* const choice : kind->second.choices) answer["choices"].push_back(choice);
  }
  answer["description"] = inOneLine(option.get_description());
  return answer;
}

void Tool::requireFittingOptions() const {
  for (const Option* const option : given_options_) {
    for (const Option* const needed : option->get_needs()) {
      if (!given_options_.contains(needed))
        throw Usage(nameOf(*option) + " needs " + nameOf(*needed));
    }
    for (const Option* const excluded : option->get_excludes()) {
      if (given_options_.contains(excluded)) {
        throw Usage(nameOf(*option) + " excludes " + nameOf(*excluded));
      }
    }
  }
}

void Tool::reportError(const std::string& what) {
  report(what);
  has_errors_ = true;
}

void Tool::report(const std::string& what) const {
  const std::string name = fullName(*selected_);
  printNotice(name + (name.empty() ? "" : ": ") + what);
}

std::string inQuotes(const std::string& text) { return '"' + text + '"'; }

bool isShellWord(std::string text) {
  return !text.empty() && !text.starts_with('-') &&
         text.find_first_of(" \t#") == std::string::npos && !checkForMetaChars(text.data());
}

Usage notShellWord(const char* what, const std::string& text) {
  return Usage(std::string("the ") + what + " is not a plain shell word: " + inQuotes(text));
}

std::string orNoMemory(std::optional<std::string> text) {
  if (!text) throw std::bad_alloc();
  return *std::move(text);
}

std::string installedPath(std::optional<std::string> path) {
  std::string text = orNoMemory(std::move(path));
  const char* const variable = getenv("VRA_LDAP_HOME");
  std::string root = variable == nullptr ? "" : variable;
  if (root.ends_with('/') || root.ends_with('\\')) root.pop_back();  // as the library does
  // The library takes the default root if it has no memory for this one.
  if (!text.starts_with(root)) throw std::bad_alloc();
  return text;
}

void requireRegularFile(const std::string& path) {
  std::string name = path;
  if (checkFilePerms(path.c_str()) == OSUTILS_SUCCESS && !isFile(name.data())) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM, path + " is not a regular file");
  }
}

const passwd* findUser(const std::string& name) {
  return lookedUp(getpwnam, name.c_str(), "the user " + inQuotes(name));
}

const group* findGroup(const std::string& name) {
  return lookedUp(getgrnam, name.c_str(), "the group " + inQuotes(name));
}

const group* findGroup(gid_t number) {
  return lookedUp(getgrgid, number, "the group " + std::to_string(number));
}

bool userExists(const std::string& name) {
  if (doesUserExist(name.c_str())) return true;
  if (findUser(name) == nullptr) return false;
  throw failedLookUp("the user " + inQuotes(name));
}

bool groupExists(const std::string& name) {
  if (doesGroupExist(name.c_str())) return true;
  if (findGroup(name) == nullptr) return false;
  throw failedLookUp("the group " + inQuotes(name));
}

void requireUser(const std::string& name) {
  if (!userExists(name)) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT, "there is no user " + inQuotes(name));
  }
}

void requireGroup(const std::string& name) {
  if (!groupExists(name)) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT, "there is no group " + inQuotes(name));
  }
}
