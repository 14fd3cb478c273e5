// The process, platform and module commands.
#include <dlfcn.h>
#include <errno.h>
#include <signal.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>

#include "command.h"

namespace processes {
namespace {

struct Options {
  std::optional<std::string> launcher_directory;
  std::vector<std::string> arguments;
  std::string pid;
  std::string program;
  std::string file;
  std::optional<std::string> symbol;
};

std::string launcherDirectory() {
  std::string path = installedPath(osutils::getVRAVrarunFilePath());
  char* text = path.data();
  (void)trimLastDirectory(&text);
  return text;
}

std::string exitDescription(int status) {
  if (WIFEXITED(status)) return "exited with status " + std::to_string(WEXITSTATUS(status));
  return "was killed by signal " + std::to_string(WTERMSIG(status));
}

Answer start(Options& options, bool dry_run) {
  std::string directory =
      options.launcher_directory ? *options.launcher_directory : launcherDirectory();
  // The library does not check it. With a "=", the shell may take it for an assignment and run the
  // first argument.
  if (!isShellWord(directory) || directory.find('=') != std::string::npos) {
    throw notShellWord("directory", directory);
  }
  std::string arguments;
  for (const std::string& argument : options.arguments) {
    // The library accepts these, but the shell would split the argument or take it for a comment.
    if (argument.empty() || argument.find_first_of(" \t") != std::string::npos ||
        argument.starts_with('#')) {
      throw notShellWord("argument", argument);
    }
    arguments += (arguments.empty() ? "" : " ") + argument;
  }
  const std::string launcher = directory + "/vrarun";
  if (dry_run) {
    if (checkForMetaChars(arguments.data())) {
      throw Usage("cannot start with the arguments " + inQuotes(arguments));
    }
    if (access(launcher.c_str(), X_OK) != 0) {
      throw Failure(OSUTILS_OPERATIONS_ERROR, launcher + ": " + strerror(errno));
    }
    return {{"would", "run"}, {"launcher", launcher}, {"arguments", arguments}};
  }
  // A server must not inherit the ignored signals.
  for (const int signal_number : {SIGPIPE, SIGXFSZ}) signal(signal_number, SIG_DFL);
  const int code = startProcess(directory.c_str(), arguments.c_str());
  for (const int signal_number : {SIGPIPE, SIGXFSZ}) signal(signal_number, SIG_IGN);
  if (code == OSUTILS_PARAM_ERROR || code == OSUTILS_NO_MEMORY) {
    throw Failure(code, "cannot start with the arguments " + inQuotes(arguments));
  }
  if (code != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  launcher + " " + (code == -1 ? "could not be run" : exitDescription(code)));
  }
  return {{"launcher", launcher}, {"arguments", arguments}};
}

// The library accepts any text. It takes 0 and text that is not a number for the caller's process
// group, and -1 for every process.
std::string requireProcessId(const std::string& text) {
  return std::to_string(numberFrom<int>(text, "PID", "a process id", 10, 1));
}

Answer stop(Options& options, bool dry_run) {
  const std::string pid = requireProcessId(options.pid);
  if (dry_run) {
    if (kill(atoi(pid.c_str()), 0) != 0) {
      throw Failure(OSUTILS_OPERATIONS_ERROR,
                    "cannot stop process " + pid + ": " + strerror(errno));
    }
    return {{"would", "kill"}, {"pid", pid}};
  }
  if (stopProcess(pid.c_str()) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot stop process " + pid);
  }
  return {{"stopped", pid}};
}

Answer status(Options& options) {
  const std::string pid = requireProcessId(options.pid);
  if (!isShellWord(options.program)) {
    throw notShellWord("program's name", options.program);
  }
  return {{"pid", pid},
          {"program", options.program},
          {"started", isProcessStarted(pid.c_str(), options.program.c_str())}};
}

Answer module(Options& options) {
  // dlopen("") returns the tool itself.
  if (options.file.empty()) throw Usage("FILE is empty");
  const osutils::SharedLib lib = osutils::loadSharedLib(options.file);
  if (!lib) {
    // Null if the library's debug message has already fetched it.
    const char* const reason = dlerror();
    throw Failure(
        OSUTILS_OPERATIONS_ERROR,
        "cannot load " + options.file + (reason != nullptr ? std::string(": ") + reason : ""));
  }
  Answer answer = {{"file", options.file}};
  if (options.symbol) {
    if (getSymAddress(lib.get(), options.symbol->c_str()) == nullptr) {
      throw Failure(OSUTILS_NO_SUCH_OBJECT,
                    options.file + " has no symbol " + inQuotes(*options.symbol));
    }
    answer["symbol"] = *options.symbol;
  }
  return answer;
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  const Tool::Argument pid = {"PID", &options->pid, "The process id"};

  Command& process = tool.family("process", "Start, stop and find server processes");
  Command& starting =
      tool.change(process, "start", "Run the launcher with these arguments and wait until it ends",
                  bound(options, start));
  tool.option(starting, "--launcher-dir", "DIR", options->launcher_directory,
              "The directory of vrarun, if not the installed one", kDirectory);
  tool.arguments(starting, "ARGUMENT", options->arguments,
                 "For the launcher; put -- before its own options");
  tool.change(process, "stop", "Kill a process with SIGKILL", bound(options, stop), {pid});
  tool.question(process, "status",
                "Ask whether a process with this id and name is running. Also matches\n"
                "an id that ends with PID, and a name that contains PROGRAM",
                bound(options, status),
                {pid, {"PROGRAM", &options->program, "The program's name"}});

  tool.command(tool.all(), "platform",
               "Show the operating system, and whether its threads are NPTL", []() -> Answer {
                 return {{"os", getOSname()}, {"nptl", isNPTL()}};
               });

  Command& checking = tool.command(
      tool.family("module", "Check shared libraries"), "check",
      "Load a shared library, which runs its constructors, and look up a symbol",
      bound(options, module),
      {{"FILE", &options->file, "The library, a path or a name as the loader looks it up", kFile}});
  tool.optionalArgument(checking, "SYMBOL", options->symbol, "A symbol that it must have");
}

}  // namespace processes
