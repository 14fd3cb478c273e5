// osutils: the library's functions on the command line.
#include <fcntl.h>
#include <ldtr.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <memory>
#include <new>
#include <sstream>
#include <vector>

#include "command.h"

namespace {

const char* resultWords(int code) {
  switch (code) {
    case OSUTILS_SUCCESS:
      return "success";
    case OSUTILS_OPERATIONS_ERROR:
      return "operations error";
    case OSUTILS_CONSTRAINT_VIOLATION:
      return "constraint violation";
    case OSUTILS_NO_SUCH_OBJECT:
      return "no such object";
    case OSUTILS_INVALID_CREDENTIALS:
      return "invalid credentials";
    case OSUTILS_INSUFFICIENT_ACCESS:
      return "insufficient access";
    case OSUTILS_UNAVAILABLE:
      return "unavailable";
    case OSUTILS_UNWILLING_TO_PERFORM:
      return "unwilling to perform";
    case OSUTILS_ALREADY_EXISTS:
      return "already exists";
    case OSUTILS_OTHER:
      return "other";
    case OSUTILS_PARAM_ERROR:
      return "parameter error";
    case OSUTILS_NO_MEMORY:
      return "no memory";
    default:
      return "unknown result";
  }
}

std::string resultText(int code) {
  return std::string(resultWords(code)) + " (" + std::to_string(code) + ")";
}

std::string withReason(const std::string& what, const std::string& path) {
  const int code = checkFilePerms(path.c_str());
  if (code == OSUTILS_SUCCESS) return resultText(OSUTILS_OPERATIONS_ERROR) + ": " + what;
  return what + "; checkFilePerms answers " + resultText(code) + " for " + path;
}

std::string json(const Answer& answer) {
  // JSON cannot carry bytes that are no UTF-8: they become U+FFFD
  return answer.dump(-1, ' ', false, Answer::error_handler_t::replace) + '\n';
}

std::string table(const Answer& answer) {
  if (answer.is_string()) return printable(answer.get<std::string>(), "\n\t");
  const Answer list = answer.is_array() ? answer : Answer::array({answer});
  if (list.empty()) return "";

  std::vector<std::vector<std::string>> rows(1);
  for (const auto& heading : list.front().items()) {
    std::string text = heading.key();
    std::transform(text.begin(), text.end(), text.begin(), [](char c) {
      return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
    });
    rows.front().push_back(text);
  }
  for (const Answer& object : list) {
    rows.emplace_back();
    for (const Answer& value : object) {
      rows.back().push_back(value.is_string() ? printable(value.get<std::string>()) : value.dump());
    }
  }

  std::vector<size_t> widths(rows.front().size());
  for (const auto& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  std::string text;
  for (const auto& row : rows) {
    for (size_t i = 0; i + 1 < row.size(); ++i) {
      text += row[i] + std::string(widths[i] - row[i].size() + 2, ' ');
    }
    text += row.back() + '\n';
  }
  return text;
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
  // an empty TRC_DIR would mean no trace
  if (directory.empty() || setenv("TRC_DIR", directory.c_str(), 1) != 0 ||
      setenv("TRC_EVENTS", "all", 0) != 0 || ldtr_init() != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot start tracing in " + directory);
  }
}

// A file that the library opens must not take the place of a closed standard output. Opened to read
// only, so that writing fails.
void reserveStandardStreams() {
  for (const int descriptor : {0, 1, 2}) {
    if (fcntl(descriptor, F_GETFD) == -1) (void)open("/dev/null", O_RDONLY);
  }
}

// "osutils: services delete: ", as far as the arguments were understood.
std::string lineBeginning(const CLI::App& tool) {
  std::string command;
  for (const CLI::App* app = &tool; !app->get_subcommands().empty();) {
    app = app->get_subcommands().front();
    command += (command.empty() ? "" : " ") + app->get_name();
  }
  return command.empty() ? "osutils: " : "osutils: " + command + ": ";
}

}  // namespace

Failure::Failure(int code, const std::string& what)
    : std::runtime_error(resultText(code) + ": " + what),
      status_(code == OSUTILS_PARAM_ERROR ? kWrongUsage : kFailed) {}

Failure::Failure(const std::string& what, const std::string& path)
    : std::runtime_error(withReason(what, path)), status_(kFailed) {}

Tool::Tool() : app_("Operating-system utilities for directory server tools", "osutils") {
  app_.set_version_flag("--version", "osutils " OSUTILS_VERSION);
  app_.require_subcommand(1);
  app_.footer(
      "The exit status is 0 after success and for yes, 1 for no, 2 for wrong usage and 3 after a\n"
      "failure. One line on standard error names the reason for 2 and 3.");
}

Command& Tool::family(const char* name, const char* description) {
  Command& family = *app_.add_subcommand(name, description);
  family.require_subcommand(1);
  return family;
}

Command& Tool::command(Command& family, const char* name, const char* description,
                       const std::function<Answer()>& run) {
  Command& command = *family.add_subcommand(name, description);
  command.callback([this, run] { run_ = run; });
  command.add_flag("--json", json_, "Answer in JSON");
  option(command, "--trace", "DIR", trace_directory_,
         "Record the library's calls in this directory, for babeltrace2");
  command.footer("The exit status is 0 after success, 2 for wrong usage and 3 after a failure.");
  return command;
}

Command& Tool::question(Command& family, const char* name, const char* description,
                        const std::function<Answer()>& run) {
  Command& added = command(family, name, description, run);
  added.callback([this, run] {
    run_ = run;
    is_question_ = true;
  });
  added.footer("The exit status is 0 for yes, 1 for no, 2 for wrong usage and 3 after a failure.");
  return added;
}

Command& Tool::change(Command& family, const char* name, const char* description,
                      const std::function<Answer(bool dry_run)>& run) {
  Command& added = command(family, name, description, [this, run] { return run(dry_run_); });
  flag(added, "--dry-run", dry_run_, "Show what would change, and change nothing");
  return added;
}

Option& Tool::option(Command& command, const char* name, const char* type,
                     std::optional<std::string>& value, const std::string& description) {
  return *command.add_option(name, value, description)->type_name(type);
}

Option& Tool::flag(Command& command, const char* name, bool& value, const char* description) {
  return *command.add_flag(name, value, description);
}

void Tool::text(Command& command, const char* name, std::string& value, const char* description) {
  command.add_option(name, value, description)->required()->type_name("");
}

void Tool::optionalText(Command& command, const char* name, std::optional<std::string>& value,
                        const std::string& description) {
  command.add_option(name, value, description)->type_name("");
}

void Tool::texts(Command& command, const char* name, std::vector<std::string>& values,
                 const char* description) {
  // The option's own results, not a vector bound to it: that takes "[a,b]" for two texts. So many
  // values are "expected" to let it take all there are.
  const Option* const option = command.add_option(name)
                                   ->description(description)
                                   ->required()
                                   ->option_text("REQUIRED")
                                   ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll)
                                   ->expected(CLI::detail::expected_max_vector_size - 1,
                                              CLI::detail::expected_max_vector_size);
  command.parse_complete_callback([option, &values] { values = option->results(); });
}

int Tool::run(int argc, char** argv) {
  try {
    try {
      app_.parse(argc, argv);
      if (trace_directory_) startTracing(*trace_directory_);
      const Answer answer = run_();
      print(json_ ? json(answer) : table(answer));
      return is_question_ && isNo(answer) ? kNo : kDone;
    } catch (const CLI::Success& request) {  // --help, --version
      std::ostringstream text;
      (void)app_.exit(request, text, text);
      print(text.str());
      return kDone;
    } catch (const CLI::ParseError& error) {
      throw Usage(error.what());
    }
  } catch (const Failure& failure) {
    const std::string line = printable(lineBeginning(app_) + failure.what()) + '\n';
    (void)fputs(line.c_str(), stderr);
    return failure.exitStatus();
  }
}

std::string printable(std::string text, std::string_view kept) {
  std::replace_if(
      text.begin(), text.end(),
      [kept](char c) {
        return (static_cast<unsigned char>(c) < ' ' || c == 127) &&
               kept.find(c) == std::string_view::npos;
      },
      '?');
  return text;
}

void notice(const std::string& line) {
  (void)fputs(("osutils: " + printable(line) + '\n').c_str(), stderr);
}

void showText(const std::string& text) { (void)fputs(printable(text, "\n\t").c_str(), stderr); }

std::string inQuotes(const std::string& text) { return '"' + text + '"'; }

bool isShellWord(std::string text) {
  return !text.empty() && !text.starts_with('-') &&
         text.find_first_of(" \t#") == std::string::npos && !checkForMetaChars(text.data());
}

std::string take(char* text) {
  const std::unique_ptr<char, FreeDeleter> owned(text);
  if (!owned) throw std::bad_alloc();
  return text;
}

void requireRegularFile(const std::string& path) {
  std::string name = path;
  if (checkFilePerms(path.c_str()) == OSUTILS_SUCCESS && !isFile(name.data())) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM, path + " is not a regular file");
  }
}

int main(int argc, char** argv) {
  reserveStandardStreams();
  signal(SIGCHLD, SIG_DFL);  // ignored, it would take the status of the library's shell commands
  signal(SIGPIPE, SIG_IGN);  // a reader that went away is a failed write like any other
  signal(SIGXFSZ, SIG_IGN);  // and so is a file that may not grow
  try {
    Tool tool;
    services::addCommands(tool);
    paths::addCommands(tool);
    files::addCommands(tool);
    accounts::addCommands(tool);
    checks::addCommands(tool);
    inittab::addCommands(tool);
    processes::addCommands(tool);
    network::addCommands(tool);
    names::addCommands(tool);
    return tool.run(argc, argv);
  } catch (const std::bad_alloc&) {
    (void)fputs("osutils: no memory (90)\n", stderr);
  } catch (const std::exception& error) {
    (void)fprintf(stderr, "osutils: other (80): %s\n", error.what());
  }
  return kFailed;
}
