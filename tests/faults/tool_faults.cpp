// Runs every command of the osutils tool while its calls fail: of each kind of call the first, the
// second and so on, once or from there on; then every call of whatever kind from the first on, the
// second on and so on. Prints a table. Ends with 1 if it found anything.
//
// Left out, since each run starts a program:
// - the calls that the tool makes before it reads its command line, except in one scenario: they are
//   the same for all commands;
// - lasting failures with the second error number;
// - in all but the first variant of a command, the second error number, and lasting failures of one
//   kind alone: there the kind still fails with all others.
#include "tool_faults.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <iostream>
#include <map>
#include <mutex>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "report_page.h"
#include "tool_scenarios.h"
#include "world.h"

namespace {

using Words = std::vector<std::string>;

constexpr int kTimeLimit = 30;  // seconds, for one run
constexpr int kLasting =
    2000;  // calls that a lasting fault fails: some are repeated until they succeed
constexpr size_t kMostFindings = 20;  // of one kind in one scenario

[[noreturn]] void stop(const std::string& what) {
  std::cerr << "tool_faults: " << what << ": " << strerror(errno) << "\n";
  exit(2);
}

// osutils runs another program for these commands, without the faults.
bool isOfReader(const Words& words) { return words.size() > 1 && words.front() == "trace"; }

// ---- One run ----

struct Fault {
  size_t kind;
  int error;
  int nth;
  bool is_lasting;  // from the nth call on
};

std::string text(const Fault& fault) {
  const char* const name = strerrorname_np(fault.error);
  return std::string(fault.kind == kAnyKind ? "any" : kKindsOfCall[fault.kind].name) + " call " +
         std::to_string(fault.nth) + (fault.is_lasting ? " on" : "") + " with " +
         (name != nullptr ? name : std::to_string(fault.error));
}

struct Run {
  bool is_late = false;
  int status = -1;  // 1000 + the signal if one ended the tool
  std::string out;
  std::string err;
  FaultReport report = {};
};

// A place for one run at a time: an empty directory, and files for the streams.
class Place {
 public:
  explicit Place(std::string path) : path_(std::move(path)) {
    std::filesystem::create_directory(path_);
  }

  std::string directory() const { return path_ + "/d"; }

  void clean() const {
    std::filesystem::remove_all(directory());
    if (mkdir(directory().c_str(), 0755) != 0) stop("mkdir " + directory());
  }

  Run run(const Words& words, const Words& environment, const std::string& input,
          const Fault* fault, bool is_watched) const {
    writeFile(path_ + "/in", input);
    Words variables = {"PATH=" + std::string(getenv("PATH") == nullptr ? "/bin" : getenv("PATH")),
                       "TZ=UTC0"};
    variables.insert(variables.end(), environment.begin(), environment.end());
    const std::string report = path_ + "/report";
    writeFile(report, std::string(sizeof(FaultReport), '\0'));
    if (is_watched) {
      variables.push_back(std::string(kReportVariable) + "=" + report);
      variables.push_back("LD_PRELOAD=" PRELOAD);
    }
    if (fault != nullptr) {
      variables.push_back(std::string(kFaultVariable) + "=" + std::to_string(fault->kind) + " " +
                          std::to_string(fault->error) + " " + std::to_string(fault->nth) + " " +
                          std::to_string(fault->is_lasting ? kLasting : 1));
    }
    Run run;
    const pid_t child = start(words, variables);
    const int handle = static_cast<int>(syscall(SYS_pidfd_open, child, 0));
    if (handle == -1) stop("pidfd_open");
    pollfd end = {handle, POLLIN, 0};
    run.is_late = poll(&end, 1, kTimeLimit * 1000) == 0;
    close(handle);
    kill(-child, SIGKILL);  // what the tool has not waited for must not meet the next run
    int status = 0;
    if (waitpid(child, &status, 0) != child) stop("waitpid");
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
    run.out = contentsOf(path_ + "/out");
    run.err = contentsOf(path_ + "/err");
    const std::string received = contentsOf(report);
    memcpy(&run.report, received.data(), sizeof run.report);
    return run;
  }

 private:
  pid_t start(const Words& words, const Words& variables) const {
    const auto pointers = [](const Words& texts) {
      std::vector<char*> list;
      for (const std::string& text : texts) list.push_back(const_cast<char*>(text.c_str()));
      list.push_back(nullptr);
      return list;
    };
    Words command = {OSUTILS_TOOL};
#ifdef OSUTILS_TRACE
    if (isOfReader(words)) command = {OSUTILS_TRACE};
#endif
    command.insert(command.end(), words.begin(), words.end());
    posix_spawn_file_actions_t streams;
    posix_spawn_file_actions_init(&streams);
    constexpr int kNew = O_WRONLY | O_CREAT | O_TRUNC;
    posix_spawn_file_actions_addopen(&streams, 0, (path_ + "/in").c_str(), O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&streams, 1, (path_ + "/out").c_str(), kNew, 0600);
    posix_spawn_file_actions_addopen(&streams, 2, (path_ + "/err").c_str(), kNew | O_APPEND, 0600);
    posix_spawn_file_actions_addclosefrom_np(&streams, 3);  // of the other threads
    posix_spawn_file_actions_addchdir_np(&streams, directory().c_str());
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETPGROUP);
    pid_t child = -1;
    const int error = posix_spawn(&child, command.front().c_str(), &streams, &attributes,
                                  pointers(command).data(), pointers(variables).data());
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&streams);
    if (error != 0) {
      errno = error;
      stop("posix_spawn " + command.front());
    }
    return child;
  }

  std::string path_;
};

// ---- What a run did ----

void replaceAll(std::string& text, const std::string& from, const std::string& to) {
  for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size()) {
    text.replace(at, from.size(), to);
  }
}

// Without what differs from run to run.
std::string comparable(std::string text, const World& world, bool has_varying_numbers) {
  replaceAll(text, world.directory, "@");
  if (has_varying_numbers) {
    const auto isDigit = [](char c) { return c >= '0' && c <= '9'; };
    std::string rest;
    for (const char c : text) {
      const char shown = isDigit(c) ? '0' : c;
      if ((shown == '0' || shown == ' ') && !rest.empty() && rest.back() == shown) continue;
      rest += shown;
    }
    text = rest;
  }
  return text;
}

std::string onOneLine(std::string text) {
  replaceAll(text, "\n", "\\n");
  return text;
}

// What the scenario's directory has, except the traces.
std::map<std::string, std::string> stateOf(const World& world) {
  std::map<std::string, std::string> state;
  const std::filesystem::path top(world.directory);
  for (auto entry = std::filesystem::recursive_directory_iterator(top);
       entry != std::filesystem::recursive_directory_iterator(); ++entry) {
    const std::string name = entry->path().lexically_relative(top).string();
    if (name == "trace") {
      entry.disable_recursion_pending();
      continue;
    }
    struct stat status = {};
    if (lstat(entry->path().c_str(), &status) != 0) continue;
    char mode[64];
    snprintf(mode, sizeof mode, "%o %u:%u ", status.st_mode, status.st_uid, status.st_gid);
    std::string rest;
    if (S_ISLNK(status.st_mode)) {
      rest = std::filesystem::read_symlink(entry->path()).string();
    } else if (S_ISREG(status.st_mode) && !name.ends_with(".lock")) {
      rest = withoutNonce(contentsOf(entry->path()));  // a lock names its holder
    }
    state[name] = mode + rest;
  }
  for (size_t i = 0; i < world.processes.size(); ++i) {
    siginfo_t end = {};
    (void)waitid(P_PID, static_cast<id_t>(world.processes[i]), &end, WEXITED | WNOHANG | WNOWAIT);
    state["process " + std::to_string(i)] =
        end.si_pid == 0 ? "runs" : "ended with " + std::to_string(end.si_status);
  }
  return state;
}

using State = std::map<std::string, std::string>;

std::string text(const State& state) {
  constexpr size_t kMostShown = 2000;  // of a page
  std::string all;
  for (const auto& [name, what] : state) {
    all +=
        name + ": " + what.substr(0, kMostShown) + (what.size() > kMostShown ? "..." : "") + "; ";
  }
  return all;
}

State withoutLocks(State state) {
  std::erase_if(state, [](const auto& entry) { return entry.first.ends_with(".lock"); });
  return state;
}

struct Outcome {
  Run run;
  State before;
  State after;
};

// ---- All faults of a scenario ----

using Calls = std::vector<int>;  // of each kind

struct Row {
  int faults = 0;
  std::vector<std::string> findings;
};

class Sweep {
 public:
  Sweep(const ToolScenario& scenario, const Place& place, const Calls& common, bool is_first)
      : scenario_(scenario), place_(place), common_(common), is_first_(is_first) {}

  Row all() {
    good_ = run(nullptr);
    if (good_.run.status != scenario_.status || good_.run.is_late) {
      row_.findings.push_back("without a fault: status " + std::to_string(good_.run.status) + ": " +
                              onOneLine(good_.run.err));
      return row_;
    }
    for (size_t kind = 0; kind < kAnyKind; ++kind) {
      const KindOfCall& each = kKindsOfCall[kind];
      // Nothing in the tool or the library looks at the error of an allocation.
      const bool is_memory = each.calls.has(Call::malloc);
      failEach({kind, each.errors[0], 1, false});
      if (is_first_ && !is_memory) failEach({kind, each.errors[1], 1, false});
      if (is_first_) failEach({kind, each.errors[0], 1, true});
    }
    failEach({kAnyKind, EIO, 1, true});
    return row_;
  }

  Calls calls() {
    const Run run = this->run(nullptr).run;
    return Calls(std::begin(run.report.calls), std::end(run.report.calls));
  }

 private:
  Outcome run(const Fault* fault) {
    place_.clean();
    world_ = {place_.directory(), {}};
    Outcome outcome;
    scenario_.prepare(world_);
    outcome.before = stateOf(world_);
    outcome.run = runAgain(fault, true);
    if (scenario_.ends_process && outcome.run.status == 0) awaitEnd(world_.processes.front());
    outcome.after = stateOf(world_);
    return outcome;
  }

  // A killed process ends some time later.
  static void awaitEnd(pid_t process) {
    const int handle = static_cast<int>(syscall(SYS_pidfd_open, process, 0));
    pollfd end = {handle, POLLIN, 0};
    (void)poll(&end, 1, 5000);
    close(handle);
  }

  // In the directory as it is.
  Run runAgain(const Fault* fault, bool is_watched) {
    return place_.run(filledIn(scenario_.words), filledIn(scenario_.environment), scenario_.input,
                      fault, is_watched);
  }

  Words filledIn(Words words) const {
    for (std::string& word : words) {
      replaceAll(word, "@", world_.directory);
      if (!world_.processes.empty()) {
        replaceAll(word, "PID", std::to_string(world_.processes.front()));
      }
    }
    return words;
  }

  void endProcesses() {
    for (const pid_t process : world_.processes) {
      kill(process, SIGKILL);
      waitpid(process, nullptr, 0);
    }
    world_.processes.clear();
  }

  // Each call of the kind. The calls before the failing one are those of the run without a fault.
  void failEach(Fault fault) {
    const bool has_common = scenario_.has_common_calls && !fault.is_lasting;
    fault.nth = has_common ? 1 : common_[fault.kind] + 1;
    size_t found = 0;
    for (; fault.nth <= good_.run.report.calls[fault.kind]; ++fault.nth) {
      const Outcome outcome = run(&fault);
      std::string finding = judge(outcome, fault);
      endProcesses();
      if (outcome.run.report.fired) {
        ++row_.faults;
      } else if (finding.empty() && !scenario_.is_verbose) {
        finding = "the call was not made again";
      }
      if (finding.empty()) continue;
      row_.findings.push_back(text(fault) + " (" + outcome.run.report.functions +
                              "): " + onOneLine(finding));
      if (++found == kMostFindings) return;
    }
  }

  std::string judge(const Outcome& outcome, const Fault& fault) {
    const Run& run = outcome.run;
    if (run.is_late) return "still ran after " + std::to_string(kTimeLimit) + " s";
    if (run.status > 3) return "status " + std::to_string(run.status) + ": " + run.err;
    const bool can_report =  // a message cannot say that messages fail
        fault.kind == kAnyKind || !kKindsOfCall[fault.kind].calls.has(Call::message);
    const scenarios::Kinds kinds =
        fault.kind == kAnyKind ? scenarios::kAnything : kKindsOfCall[fault.kind].kind;
    const bool is_answer = run.status < 2 || run.status == scenario_.status;
    if (is_answer && (kinds & scenario_.may_mislead) != 0) return "";
    if (run.status == scenario_.status) {
      if (scenario_.status < 2 && shown(run.out) != shown(good_.run.out))
        return "success with the output " + run.out;
      if (scenario_.status < 2 && !scenario_.is_verbose && shown(run.err) != shown(good_.run.err) &&
          can_report) {
        return "success with the message " + run.err;
      }
      if (scenario_.status >= 2 && can_report && !isMessage(run.err)) return "no message";
      if (withoutLocks(outcome.after) != withoutLocks(good_.after)) {
        return "success with the files " + text(outcome.after);
      }
      return "";
    }
    if (run.status < 2) return "the answer is " + std::to_string(run.status) + ": " + run.err;
    if (run.status == 2) return "wrong usage: " + run.err;
    if (can_report && !isMessage(run.err)) return "no message: " + run.err;
    return judgeFailure(outcome);
  }

  // Files after a failure, and after the next run.
  std::string judgeFailure(const Outcome& outcome) {
    const State state = withoutLocks(outcome.after);
    const bool is_old = state == withoutLocks(outcome.before);
    const bool is_new = state == withoutLocks(good_.after);
    if (!is_old && !is_new &&
        !(scenario_.may_leave && scenario_.may_leave(state, outcome.run.err))) {
      return "failure with the files " + text(outcome.after) + " and the message " +
             outcome.run.err;
    }
    // Otherwise the next run is the same as one without a fault.
    if (is_old || scenario_.status >= 2) return "";
    for (const Words& words : scenario_.repair) {
      (void)place_.run(filledIn(words), filledIn(scenario_.environment), "", nullptr, false);
    }
    const Run next = runAgain(nullptr, false);
    if (const State repaired = stateOf(world_);
        withoutLocks(repaired) != withoutLocks(good_.after)) {
      return "the next run leaves the files " + text(repaired) + " and the message " + next.err +
             " after " + outcome.run.err;
    }
    return "";
  }

  bool isMessage(const std::string& err) const {
    return err.find_first_not_of('\n') != std::string::npos && err.ends_with('\n');
  }

  std::string shown(const std::string& text) const {
    return comparable(text, world_, scenario_.has_varying_numbers);
  }

  const ToolScenario& scenario_;
  const Place& place_;
  const Calls& common_;
  const bool is_first_;  // of the command
  World world_;
  Outcome good_;
  Row row_;
};

// ---- All scenarios ----

// The words after the "Subcommands:" of the help.
Words subcommandsOf(const Place& place, const Words& command) {
  Words words = {"help"};
  words.insert(words.end(), command.begin(), command.end());
  place.clean();
  std::istringstream help(place.run(words, {}, "", nullptr, false).out);
  Words found;
  bool is_list = false;
  for (std::string line; std::getline(help, line);) {
    if (line == "Subcommands:") {
      is_list = true;
    } else if (is_list && line.starts_with("  ") && line.size() > 2 && line[2] != ' ') {
      found.push_back(line.substr(2, line.find(' ', 2) - 2));
    } else if (is_list && line.empty()) {
      break;
    }
  }
  return found;
}

// "services list" and so on: all commands without subcommands.
std::set<std::string> commandsOfTheTool(const Place& place, const Words& family = {}) {
  std::set<std::string> commands;
  for (const std::string& name : subcommandsOf(place, family)) {
    Words command = family;
    command.push_back(name);
    const std::string full = family.empty() ? name : family.front() + " " + name;
    const std::set<std::string> below = commandsOfTheTool(place, command);
    if (below.empty()) {
      commands.insert(full);
    } else {
      commands.insert(below.begin(), below.end());
    }
  }
  return commands;
}

struct Total {
  int scenarios = 0;
  int faults = 0;
  int findings = 0;
};

void print(const std::string& name, const Total& total) {
  printf("%-62s %9d %7d %8d\n", name.c_str(), total.scenarios, total.faults, total.findings);
}

std::string nameOf(const ToolScenario& scenario) {
  return "osutils " + scenario.command + (scenario.variant.empty() ? "" : " " + scenario.variant);
}

// What all commands of the program call before the command line is read.
Calls commonCalls(const Place& place, const Words& family) {
  ToolScenario usage = {.command = "", .variant = "", .words = family, .status = 2};
  usage.words.push_back("--unknown");
  // "--version" alone is answered before the commands are made.
  ToolScenario shortest = {.command = "", .variant = "", .words = family};
  shortest.words.emplace_back(family.empty() ? "help" : "--version");
  const Calls none(kKinds);
  Calls common = Sweep(shortest, place, none, false).calls();
  const Calls others = Sweep(usage, place, none, false).calls();
  for (size_t kind = 0; kind < kKinds; ++kind) {
    const bool is_parsing = kind == kAnyKind || kKindsOfCall[kind].calls.has(Call::malloc);
    common[kind] = std::max(0, std::min(common[kind], others[kind]) - (is_parsing ? 60 : 0));
  }
  return common;
}

int runAll(const std::vector<ToolScenario>& scenarios, const std::string& directory) {
  const Place first(directory + "/first");
  const Calls common = commonCalls(first, {});
#ifdef OSUTILS_TRACE
  const Calls common_of_reader = commonCalls(first, {"trace"});
#else
  const Calls& common_of_reader = common;
#endif
  std::vector<bool> is_first;
  std::set<std::string> seen;
  for (const ToolScenario& scenario : scenarios) {
    is_first.push_back(seen.insert(scenario.command).second);
  }

  std::vector<Row> rows(scenarios.size());
  std::atomic<size_t> next = 0;
  std::vector<std::thread> workers;
  const unsigned int count = std::thread::hardware_concurrency() + 1;  // each waits for its runs
  for (unsigned int worker = 0; worker < count; ++worker) {
    workers.emplace_back([&, worker] {
      const Place place(directory + "/" + std::to_string(worker));
      for (size_t number = 0; (number = next++) < scenarios.size();) {
        const Calls& before = isOfReader(scenarios[number].words) ? common_of_reader : common;
        rows[number] = Sweep(scenarios[number], place, before, is_first[number]).all();
      }
    });
  }
  for (std::thread& worker : workers) worker.join();

  std::map<std::string, Total> commands;
  Total sum;
  for (size_t number = 0; number < scenarios.size(); ++number) {
    const int findings = static_cast<int>(rows[number].findings.size());
    for (Total* const total : {&commands["osutils " + scenarios[number].command], &sum}) {
      ++total->scenarios;
      total->faults += rows[number].faults;
      total->findings += findings;
    }
  }
  printf("%-62s %9s %7s %8s\n", "command", "scenarios", "faults", "findings");
  for (const auto& [name, total] : commands) print(name, total);
  print("all", sum);
  for (size_t number = 0; number < scenarios.size(); ++number) {
    for (const std::string& finding : rows[number].findings) {
      printf("FINDING %s: %s\n", nameOf(scenarios[number]).c_str(), finding.c_str());
    }
  }
  return sum.findings == 0 ? 0 : 1;
}

// Every command has a scenario.
int check(const std::vector<ToolScenario>& scenarios, const std::string& directory) {
  const std::set<std::string> commands = commandsOfTheTool(Place(directory + "/help"));
  std::set<std::string> covered;
  for (const ToolScenario& scenario : scenarios) covered.insert(scenario.command);
  int status = commands.empty() ? 1 : 0;
  for (const std::string& command : commands) {
    if (covered.contains(command)) continue;
    printf("FINDING no scenario runs osutils %s\n", command.c_str());
    status = 1;
  }
  for (const std::string& command : covered) {
    if (commands.contains(command)) continue;
    printf("FINDING a scenario runs osutils %s, which is not a command\n", command.c_str());
    status = 1;
  }
  return status;
}

}  // namespace

// tool_faults [check | NAME...]: with names only the scenarios whose name begins with one of them.
int main(int count, char** arguments) {
  if (std::filesystem::path(arguments[0]).filename() == "vrarun") return launcher(count, arguments);
  const rlimit no_dumps = {0, 0};
  (void)setrlimit(RLIMIT_CORE, &no_dumps);
  setenv("TMPDIR", "/dev/shm", 1);  // an edit waits for the disk
  std::vector<ToolScenario> scenarios = toolScenarios();
  const TempDir temp;
  const Words names(arguments + 1, arguments + count);
  if (names == Words{"check"}) return check(scenarios, temp.path());
  if (names.empty()) {
    const int status = check(scenarios, temp.path());
    return std::max(status, runAll(scenarios, temp.path()));
  }
  std::erase_if(scenarios, [&](const ToolScenario& scenario) {
    return std::none_of(names.begin(), names.end(), [&](const std::string& name) {
      return nameOf(scenario).starts_with(name);
    });
  });
  if (scenarios.empty()) {
    std::cerr << "tool_faults: no scenario has this name\n";
    return kNoScenario;
  }
  return runAll(scenarios, temp.path());
}
