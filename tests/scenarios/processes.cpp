// Server processes, the thread library and the name of the platform.

#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <stdexcept>

#include "osutils.h"
#include "scenario.h"
#include "world.h"

namespace scenarios {
namespace {

// A shell script.
void makeProgram(const std::string& name, const std::string& script) {
  writeFile(path(name), "#!/bin/sh\n" + script + "\n");
  std::filesystem::permissions(path(name), std::filesystem::perms(0755));
}

// ---- startProcess ----

// No file for an empty text.
void setRelease(const std::string& name, const std::string& text) {
  if (pathExists("/etc/" + name)) std::filesystem::remove(etcFile(name));
  if (!text.empty()) writeFile(etcFile(name), text);
}

// A launcher that writes its arguments to a file and ends with this command, on a machine with these
// release files.
void makeLauncher(const std::string& last_command, const std::string& red_hat = "",
                  const std::string& suse = "") {
  makeProgram("vrarun", "echo \"$*\" > \"${0%/*}/started\"\n" + last_command);
  setRelease("redhat-release", red_hat);
  setRelease("SuSE-release", suse);
}

bool isNumber(const std::string& text) {
  return text.find_first_not_of("-0123456789") == std::string::npos;
}

// The shell or the launcher has failed. Its status is the result, unless it was lost.
std::vector<End> launcherFailed(const std::string& words) {
  std::vector<End> ends;
  for (const std::string& text : {words, std::string(), std::string("not started")}) {
    ends.push_back({kShell, Expected(isNumber), text});
  }
  return ends;
}

std::string started() {
  return pathExists(path("started")) ? contentsOf(path("started")) : "not started";
}

Scenario start(const std::string& name, const std::string& last_command, const char* arguments,
               const std::string& result) {
  const std::string words = std::string(arguments) + "\n";
  Scenario scenario{.name = "startProcess, " + name,
                    .symbols = {"startProcess"},
                    .prepare = [last_command] { makeLauncher(last_command); },
                    .run = [arguments] { return shown(startProcess(path("."), arguments)); },
                    .state = started,
                    .ends = {{kNothing, result, words},
                             {kMemory | kPrint, "90", "not started"},
                             {kProcess, "-1", "not started"}}};
  for (const End& end : launcherFailed(words)) scenario.ends.push_back(end);
  return scenario;
}

// The status of children is lost while SIGCHLD is ignored.
Scenario startAndLoseStatus(const std::string& name, const std::string& red_hat,
                            const std::string& suse, bool is_recognised) {
  const std::string result = is_recognised ? "0" : "-1";
  Scenario scenario{.name = "startProcess, whose status is lost " + name,
                    .symbols = {"startProcess"},
                    .prepare = [red_hat, suse] { makeLauncher("exit 3", red_hat, suse); },
                    .run =
                        [] {
                          signal(SIGCHLD, SIG_IGN);
                          const int rc = startProcess(path("."), "inst1");
                          signal(SIGCHLD, SIG_DFL);
                          return shown(rc);
                        },
                    .state = started,
                    .ends = {{kNothing, result, "inst1\n"},
                             {kMemory | kPrint, "90", "not started"},
                             {kProcess, result, "not started"}},
                    .repeatable = false};
  for (const End& end : launcherFailed("inst1\n")) scenario.ends.push_back(end);
  if (is_recognised) {
    // The release file is not read.
    scenario.ends.push_back({kStatus | kOpen | kRead, "-1", "inst1\n"});
    scenario.ends.push_back({kStatus | kOpen | kRead, "-1", "not started"});
  }
  return scenario;
}

Scenario startRefused(const std::string& name, const char* arguments) {
  return {.name = "startProcess, " + name,
          .symbols = {"startProcess"},
          .prepare = [] { makeLauncher(""); },
          .run = [arguments] { return shown(startProcess(path("."), arguments)); },
          .state = started,
          .ends = {{kNothing, "89", "not started"}}};
}

// ---- Other processes ----

// A process that waits until it is killed, in a group of its own.
class Other {
 public:
  explicit Other(const char* name) {
    int ready[2];
    if (pipe(ready) != 0) throw std::runtime_error("pipe");
    pid_ = fork();
    if (pid_ == 0) {
      setpgid(0, 0);
      prctl(PR_SET_NAME, name);
      prctl(PR_SET_PDEATHSIG, SIGKILL);
      (void)!write(ready[1], "", 1);
      for (;;) pause();
    }
    char byte;
    const bool is_ready = pid_ > 1 && read(ready[0], &byte, 1) == 1;
    close(ready[0]);
    close(ready[1]);
    if (!is_ready) throw std::runtime_error("another process");
  }
  ~Other() {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  Other(const Other&) = delete;
  Other& operator=(const Other&) = delete;

  pid_t pid() const { return pid_; }

  // "killed" or "alive". Waits for the end after a success.
  std::string fate(int rc) const {
    const int descriptor = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
    pollfd ended = {descriptor, POLLIN, 0};
    const bool was_killed = poll(&ended, 1, rc == 0 ? 5000 : 0) == 1;
    close(descriptor);
    return was_killed ? "killed" : "alive";
  }

 private:
  pid_t pid_;
};

Scenario stop(const std::string& name, int sign) {
  return {.name = "stopProcess, " + name,
          .symbols = {"stopProcess"},
          .run =
              [sign] {
                const Other other("other");
                const int rc = stopProcess(std::to_string(sign * other.pid()).c_str());
                return shown(rc) + " " + other.fate(rc);
              },
          .ends = {{kNothing, "0 killed"}, {kProcess, "-1 alive"}}};
}

Scenario stopRefused(const std::string& name, const char* pid, const std::string& result) {
  return {.name = "stopProcess, " + name,
          .symbols = {"stopProcess"},
          .run = [pid] { return shown(stopProcess(pid)); },
          .ends = {{kNothing, result}}};
}

// Asks for a live process, whose name no other one has.
Scenario isStarted(const std::string& name, const std::string& end_of_name, bool result) {
  return {.name = "isProcessStarted, " + name,
          .symbols = {"isProcessStarted"},
          .run =
              [=] {
                const std::string own_name = "osu-" + std::to_string(getpid());
                const Other other(own_name.c_str());
                return shown(isProcessStarted(std::to_string(other.pid()).c_str(),
                                              (own_name + end_of_name).c_str()));
              },
          .ends = {{kNothing, shown(result)}, {kMemory | kPrint | kProcess, "false"}}};
}

Scenario isStartedRefused(const std::string& name, const char* pid, const char* program) {
  return {.name = "isProcessStarted, " + name,
          .symbols = {"isProcessStarted"},
          .run = [=] { return shown(isProcessStarted(pid, program)); },
          .ends = {{kNothing, "false"}}};
}

// ---- Programs that the shell finds ----

// Lets the shell find the scenario's own programs before the machine's, until the end of the scope.
class SearchOwnFirst {
 public:
  SearchOwnFirst() { setenv("PATH", (std::string(path(".")) + ":" + before_).c_str(), 1); }
  ~SearchOwnFirst() { setenv("PATH", before_.c_str(), 1); }
  SearchOwnFirst(const SearchOwnFirst&) = delete;
  SearchOwnFirst& operator=(const SearchOwnFirst&) = delete;

 private:
  const std::string before_ = getenv("PATH");
};

// The machine's ps prints this line.
Scenario isListed(const std::string& name, const std::string& line, bool result) {
  return {.name = "isProcessStarted, " + name,
          .symbols = {"isProcessStarted"},
          .prepare = [line] { makeProgram("ps", "echo '" + line + "'"); },
          .run =
              [] {
                const SearchOwnFirst search;
                return shown(isProcessStarted("123", "vraslapd"));
              },
          .ends = {{kNothing, shown(result)}, {kMemory | kPrint | kProcess, "false"}}};
}

Scenario threads(const std::string& name, const std::string& thread_library, bool result) {
  const std::string both = shown(result) + " " + shown(result);
  return {.name = "isNPTL, " + name,
          .symbols = {"_Z6isNPTLv"},
          .prepare =
              [thread_library] {
                makeProgram("getconf", "[ \"$*\" != GNU_LIBPTHREAD_VERSION ] || echo '" +
                                           thread_library + "'");
              },
          .run =
              [] {
                const SearchOwnFirst search;
                const bool first = isNPTL();
                return shown(first) + " " + shown(isNPTL());
              },
          .ends = {{kNothing, both, "", {0, 1}},
                   {kProcess, "false false"},
                   {kRead, "false false", "", {0, 1}}},
          .repeated = kRead,
          .repeatable = false};
}

}  // namespace

std::vector<Scenario> processScenarios() {
  constexpr char kRedHat5[] = "Red Hat Enterprise Linux Server release 5 (Tikanga)\n";
  constexpr char kSuSE9[] = "SUSE LINUX Enterprise Server 9 (x86_64)\nVERSION = 9\n";
  return {
      start("one argument", "exit 0", "inst1", "0"),
      start("two arguments", "exit 0", "a b", "0"),
      start("whose launcher fails", "exit 3", "inst1", "768"),
      start("whose launcher is killed", "kill -9 $$", "inst1", "35072"),
      startAndLoseStatus("nowhere", "", "", false),
      startAndLoseStatus("on Red Hat", kRedHat5, "", true),
      startAndLoseStatus("on SuSE", "", kSuSE9, true),
      startAndLoseStatus("on other releases", "Red Hat release 6 " + std::string(250, 'x'),
                         "openSUSE\nVERSION = 8\n", false),
      startRefused("a metacharacter", "inst;rm"),
      startRefused("null arguments", nullptr),
      {.name = "startProcess, a null directory",
       .symbols = {"startProcess"},
       .run = [] { return shown(startProcess(nullptr, "inst1")); },
       .ends = {{kNothing, "89"}}},
      stop("a process", 1),
      stop("a group", -1),
      stopRefused("nobody", "2147483647", "-1"),
      stopRefused("a metacharacter", "2147483647;", "89"),
      stopRefused("null", nullptr, "89"),
      isStarted("live", "", true),
      isStarted("another name", "x", false),
      isListed("found with more digits", " 4123 vraslapd", true),
      isListed("a zombie", " 123 vraslapd <defunct>", false),
      isStartedRefused("a metacharacter in the id", "1;", "a"),
      isStartedRefused("a metacharacter in the name", "1", "a|b"),
      isStartedRefused("a null id", nullptr, "a"),
      isStartedRefused("a null name", "1", nullptr),
      threads("NPTL", "NPTL 2.5", true),
      threads("others", "linuxthreads-0.10", false),
      {.name = "getOSname",
       .symbols = {"getOSname"},
       .run = [] { return std::string(getOSname()); },
       .ends = {{kNothing, "Linux-x64"}}},
  };
}

}  // namespace scenarios
