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

// Arguments and files may hold anything; a line must stay one line and a terminal must not obey it.
std::string printable(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return (c >= 0 && c < ' ') || c == 127; }, '?');
  return text;
}

std::string json(const Answer& answer) {
  // JSON cannot carry bytes that are no UTF-8: they become U+FFFD
  return answer.dump(-1, ' ', false, Answer::error_handler_t::replace) + '\n';
}

std::string table(const Answer& answer) {
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

int run(int argc, char** argv) {
  CLI::App tool("Operating-system utilities for directory server tools", "osutils");
  Chosen chosen;
  tool.set_version_flag("--version", "osutils " OSUTILS_VERSION);
  tool.require_subcommand(1);
  tool.footer(
      "The exit status is 0, or 1 after a failure, with one line on standard error that names the\n"
      "result code, and for the answer \"no\" to a question.");
  services::addCommands(tool, chosen);
  paths::addCommands(tool, chosen);
  files::addCommands(tool, chosen);
  accounts::addCommands(tool, chosen);
  checks::addCommands(tool, chosen);
  inittab::addCommands(tool, chosen);
  processes::addCommands(tool, chosen);
  network::addCommands(tool, chosen);
  names::addCommands(tool, chosen);
  std::string failure;
  try {
    try {
      tool.parse(argc, argv);
      if (chosen.trace_directory) startTracing(*chosen.trace_directory);
      const Answer answer = chosen.run();
      print(chosen.json ? json(answer) : table(answer));
      if (chosen.is_question && isNo(answer)) return EXIT_FAILURE;
    } catch (const CLI::Success& request) {  // --help, --version
      std::ostringstream text;
      (void)tool.exit(request, text, text);
      print(text.str());
    }
    return EXIT_SUCCESS;
  } catch (const Failure& error) {
    failure = error.what();
  } catch (const CLI::ParseError& error) {
    failure = Failure(OSUTILS_PARAM_ERROR, error.what()).what();
  }
  const std::string line = printable(lineBeginning(tool) + failure) + '\n';
  (void)fputs(line.c_str(), stderr);
  return EXIT_FAILURE;
}

}  // namespace

Failure::Failure(int code, const std::string& what)
    : std::runtime_error(resultText(code) + ": " + what) {}

Failure::Failure(const std::string& what, const std::string& path)
    : std::runtime_error(withReason(what, path)) {}

CLI::App& addCommand(CLI::App& family, Chosen& chosen, const char* name, const char* description,
                     const std::function<Answer()>& run) {
  CLI::App& command = *family.add_subcommand(name, description);
  command.callback([&chosen, run] { chosen.run = run; });
  command.add_flag("--json", chosen.json, "Answer in JSON");
  command
      .add_option("--trace", chosen.trace_directory,
                  "Record the library's calls in this directory, for babeltrace2")
      ->type_name("DIR");
  return command;
}

CLI::App& addQuestion(CLI::App& family, Chosen& chosen, const char* name, const char* description,
                      const std::function<Answer()>& run) {
  CLI::App& command = addCommand(family, chosen, name, description, run);
  command.callback([&chosen, run] {
    chosen.run = run;
    chosen.is_question = true;
  });
  command.footer("The exit status is 0 for yes and 1 for no.");
  return command;
}

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
  try {
    return run(argc, argv);
  } catch (const std::bad_alloc&) {
    (void)fputs("osutils: no memory (90)\n", stderr);
  } catch (const std::exception& error) {
    (void)fprintf(stderr, "osutils: other (80): %s\n", error.what());
  }
  return EXIT_FAILURE;
}
