// Runs every scenario while its calls fail: of each kind of call the first, the second and so on,
// once or from there on, until a run needs no failure; then every call of whatever kind from the
// first on, the second on and so on. Prints a table. Ends with 1 if it found anything.
#include "faults.h"

#include <cxxabi.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <limits.h>
#include <netdb.h>
#include <poll.h>
#include <pwd.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iostream>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "imports.h"
#include "kinds.h"
#include "scenario.h"
#include "subject.h"
#include "world.h"

namespace {

using scenarios::Left;
using scenarios::Outcome;
using scenarios::Scenario;

constexpr int kTimeLimit = 60;  // seconds, for one run
// How many calls a lasting fault fails: more than a scenario makes, unless it repeats one until it
// succeeds.
constexpr int kLasting = 2000;

[[noreturn]] void stop(const std::string& what) {
  std::cerr << "faults: " << what << ": " << strerror(errno) << "\n";
  exit(2);
}

// ---- One run ----

struct Fault {
  std::string name;
  scenarios::Kinds kinds;
  CallSet calls;
  int error;
  int nth;
  bool is_lasting;  // from the nth call on
};

std::string text(const Fault& fault) {
  const char* const error = strerrorname_np(fault.error);
  return fault.name + " call " + std::to_string(fault.nth) + (fault.is_lasting ? " on" : "") +
         " with " + (error != nullptr ? error : std::to_string(fault.error));
}

void makeDirectory(const std::string& path) {
  if (mkdir(path.c_str(), 0755) != 0) stop("cannot make " + path);
}

struct Run {
  Outcome outcome;
  Left left;
  bool fired = false;
  bool outlasted = false;  // the library made more calls than a lasting fault fails
};

// Runs the scenario in a new directory of this name.
Run runScenario(const Scenario& scenario, const std::string& directory, const Fault* fault) {
  makeDirectory(directory);
  scenarios::setDirectory(directory);
  scenario.prepare();
  Run run;
  const FakeSleep no_waiting([] {
    if (scenarios::instead_of_waiting) scenarios::instead_of_waiting();
  });
  const subject::Tracing tracing(scenario);
  const int descriptors = openDescriptors();
  {
    const LiveAllocations live;
    std::optional<FailingCall> failing;
    if (fault != nullptr) {
      failing.emplace(fault->calls, fault->error, fault->nth, fault->is_lasting ? kLasting : 1);
    }
    run.outcome.result = scenario.run();
    run.fired = failing && failing->fired();
    run.outlasted = run.fired && fault->is_lasting && failing->calls() >= fault->nth + kLasting;
    failing.reset();
    run.left.blocks = live.blocks();
  }
  run.left.descriptors = openDescriptors() - descriptors;
  if (subject::kLeavesAsInScenario) run.outcome.left = run.left;
  run.outcome.state = scenario.state();
  return run;
}

// What a process that ran the scenario reports.
struct Report {
  bool fired = false;
  Left left;
  std::string finding;
};

// Runs the scenario with the fault, and again without one: no failure may spoil the next call.
Report runTwice(const Scenario& scenario, const std::string& directory, const Fault* fault) {
  const Run first = runScenario(scenario, directory + "/first", fault);
  Report report;
  report.fired = first.fired;
  report.left = first.left;
  report.finding =
      judge(scenario, fault == nullptr || !first.fired ? 0 : fault->kinds, first.outcome);
  if (report.finding.empty() && first.outlasted && (scenario.repeated & fault->kinds) == 0) {
    report.finding = "repeats a call that goes on failing";
  }
  if (scenario.repeatable && report.finding.empty()) {
    const Run second = runScenario(scenario, directory + "/second", nullptr);
    report.finding = judge(scenario, scenarios::kNothing, second.outcome);
    if (!report.finding.empty()) report.finding = "the next call: " + report.finding;
  }
  return report;
}

// ---- The process of a run ----

std::string endOf(const siginfo_t& child) {
  if (child.si_code == CLD_EXITED) {
    return child.si_status == 0 ? "" : "ended with " + std::to_string(child.si_status);
  }
  return std::string("killed by ") + strsignal(child.si_status);
}

// Runs the scenario in a process of its own, in an empty directory of this name.
Report runInProcess(const Scenario& scenario, const std::string& directory, const Fault* fault) {
  makeDirectory(directory);
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) stop("pipe");
  const pid_t child = fork();
  if (child == -1) stop("fork");
  if (child == 0) {
    setpgid(0, 0);
    const int messages =
        open((directory + "/messages").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    if (messages == -1 || dup2(messages, STDERR_FILENO) == -1 || close(messages) != 0) _exit(3);
    const Report report = runTwice(scenario, directory, fault);
    char sent[PIPE_BUF];  // fits into the pipe: it is read only after the end of the process
    const int length =
        std::min<int>(snprintf(sent, sizeof sent, "%d %d %d %s", report.fired, report.left.blocks,
                               report.left.descriptors, report.finding.c_str()),
                      sizeof sent - 1);
    _exit(write(ends[1], sent, static_cast<size_t>(length)) == length ? 0 : 3);
  }
  close(ends[1]);
  pollfd wanted = {ends[0], POLLIN, 0};  // a report, or the end of the process
  const bool is_late = poll(&wanted, 1, kTimeLimit * 1000) == 0;
  if (is_late) kill(-child, SIGKILL);
  siginfo_t status;
  if (waitid(P_PID, static_cast<id_t>(child), &status, WEXITED) != 0) stop("waitid");
  char received[PIPE_BUF] = "";
  (void)!read(ends[0], received, sizeof received - 1);
  close(ends[0]);
  Report report;
  int fired = 0;
  int text = 0;
  const bool is_report = sscanf(received, "%d %d %d %n", &fired, &report.left.blocks,
                                &report.left.descriptors, &text) == 3;
  report.fired = fired != 0;
  report.finding = received + text;
  if (is_late) {
    report.finding = "still ran after " + std::to_string(kTimeLimit) + " s";
  } else if (const std::string end = endOf(status); !end.empty()) {
    report.finding = end;
  } else if (!is_report) {
    report.finding = "ended without a report";
  }
  if (!report.finding.empty()) {
    report.finding += " " + contentsOf(directory + "/messages").substr(0, 200);
  }
  std::filesystem::remove_all(directory);
  subject::removeTrace(child);
  return report;
}

std::string onOneLine(std::string text) {
  for (size_t at = 0; (at = text.find('\n', at)) != std::string::npos; at += 2) {
    text.replace(at, 1, "\\n");
  }
  return text;
}

// ---- All faults of a scenario ----

struct Row {
  int faults = 0;
  std::vector<std::string> findings;
};

class Sweep {
 public:
  Sweep(const Scenario& scenario, std::string directory)
      : scenario_(scenario), directory_(std::move(directory)) {}

  Row all() {
    good_ = run(nullptr);
    if (!good_.finding.empty()) {
      row_.findings.push_back("without a fault: " + onOneLine(good_.finding));
      return row_;
    }
    most_left_ = good_.left;
    for (const scenarios::End& end : scenario_.ends) {
      most_left_.blocks = std::max(most_left_.blocks, end.left.blocks);
      most_left_.descriptors = std::max(most_left_.descriptors, end.left.descriptors);
    }
    scenarios::Kinds all_effects = scenarios::kNothing;
    for (const KindOfCall& kind : kKindsOfCall) {
      all_effects |= subject::effectsOf(kind);
      for (const int error : kind.errors) {
        for (const bool is_lasting : {false, true}) {
          failEach({kind.name, subject::effectsOf(kind), kind.calls, error, 1, is_lasting});
        }
      }
    }
    for (const int error : {EIO, ENOMEM}) {
      failEach({"any", all_effects, allKindsOfCall(), error, 1, true});
    }
    return row_;
  }

 private:
  Report run(const Fault* fault) {
    return runInProcess(scenario_, directory_ + "/" + std::to_string(runs_++), fault);
  }

  // Until a run makes fewer calls than would be needed for the failure.
  void failEach(Fault fault) {
    for (;; ++fault.nth) {
      Report report = run(&fault);
      if (report.fired) ++row_.faults;
      if (!subject::kLeavesAsInScenario && report.finding.empty() &&
          (report.left.blocks > most_left_.blocks ||
           report.left.descriptors > most_left_.descriptors)) {
        report.finding = "left " + text(report.left) + ", at most allowed are " + text(most_left_);
      }
      if (!report.finding.empty()) {
        row_.findings.push_back(text(fault) + ": " + onOneLine(report.finding));
      }
      // After a crash it is unknown whether the fault fired; so many in a row are enough.
      if (!report.fired && (report.finding.empty() || fault.nth > 20)) return;
    }
  }

  const Scenario& scenario_;
  const std::string directory_;
  Report good_;     // without a fault
  Left most_left_;  // by any end of the scenario
  int runs_ = 0;
  Row row_;
};

// ---- All scenarios ----

// What the C library keeps after its first use is there before any run.
void useLibraryOnce() {
  setenv("TZ", "UTC0", 1);
  tzset();
  (void)getpwnam("root");
  (void)getgrnam("root");
  (void)gethostbyname("localhost");
  addrinfo* found = nullptr;
  if (getaddrinfo("localhost", nullptr, nullptr, &found) == 0) freeaddrinfo(found);
}

std::string demangled(const std::string& symbol) {
  int status = 0;
  const std::unique_ptr<char, void (*)(void*)> name(
      abi::__cxa_demangle(symbol.c_str(), nullptr, nullptr, &status), free);
  return status == 0 ? name.get() : symbol;
}

// Runs every scenario whose number is `first` modulo `step`, and prints one line for each, and one
// for each finding.
void runShare(const std::vector<Scenario>& chosen, size_t first, size_t step,
              const std::string& directory, FILE* out) {
  useLibraryOnce();
  for (size_t number = first; number < chosen.size(); number += step) {
    const std::string own = directory + "/" + std::to_string(number);
    makeDirectory(own);
    const Row row = Sweep(chosen[number], own).all();
    fprintf(out, "scenario %zu %d\n", number, row.faults);
    for (const std::string& finding : row.findings) {
      fprintf(out, "finding %zu %s\n", number, finding.c_str());
    }
    fflush(out);
  }
}

struct Total {
  int scenarios = 0;
  int faults = 0;
  int findings = 0;
};

void print(const std::string& name, const Total& total) {
  printf("%-62s %9d %7d %8d\n", name.c_str(), total.scenarios, total.faults, total.findings);
}

int runAll(const std::vector<Scenario>& chosen) {
  const TempDir temp;
  const size_t workers = std::thread::hardware_concurrency() + 1;  // each waits for its runs
  std::vector<FILE*> outputs;
  std::vector<pid_t> children;
  for (size_t worker = 0; worker < workers; ++worker) {
    FILE* const out = tmpfile();
    if (out == nullptr) stop("tmpfile");
    outputs.push_back(out);
    const pid_t child = fork();
    if (child == -1) stop("fork");
    if (child == 0) {
      // What one process writes into /etc is not seen by the other ones.
      _exit(withPrivateNetwork([&] {
        runShare(chosen, worker, workers, temp.path(), out);
        return 0;
      }));
    }
    children.push_back(child);
  }
  bool is_complete = true;
  for (const pid_t child : children) {
    int status = 0;
    if (waitpid(child, &status, 0) != child || status != 0) is_complete = false;
  }

  std::vector<Row> rows(chosen.size());
  for (FILE* const out : outputs) {
    rewind(out);
    char* line = nullptr;
    size_t capacity = 0;
    while (getline(&line, &capacity, out) > 0) {
      size_t number = 0;
      int faults = 0;
      int text = 0;
      line[strcspn(line, "\n")] = '\0';
      if (sscanf(line, "scenario %zu %d", &number, &faults) == 2) {
        rows.at(number).faults = faults;
      } else if (sscanf(line, "finding %zu %n", &number, &text) == 1) {
        rows.at(number).findings.emplace_back(line + text);
      }
    }
    free(line);
    fclose(out);
  }

  std::map<std::string, Total> functions;
  Total sum;
  for (size_t number = 0; number < chosen.size(); ++number) {
    const int findings = static_cast<int>(rows[number].findings.size());
    std::set<std::string> names;
    for (const std::string& symbol : chosen[number].symbols) names.insert(demangled(symbol));
    for (const std::string& name : names) {
      Total& total = functions[name];
      ++total.scenarios;
      total.faults += rows[number].faults;
      total.findings += findings;
    }
    ++sum.scenarios;
    sum.faults += rows[number].faults;
    sum.findings += findings;
  }
  printf("%-62s %9s %7s %8s\n", "function", "scenarios", "faults", "findings");
  for (const auto& [name, total] : functions) print(name, total);
  print("all", sum);
  for (size_t number = 0; number < chosen.size(); ++number) {
    for (const std::string& finding : rows[number].findings) {
      printf("FINDING %s: %s\n", chosen[number].name.c_str(), finding.c_str());
    }
  }
  if (!is_complete) printf("FINDING a process of the driver ended early\n");
  return sum.findings == 0 && is_complete ? 0 : 1;
}

std::set<std::string> allImports() {
  std::set<std::string> imports;
  for (const std::string& caller : subject::callers()) imports.merge(importsOf(caller));
  return imports;
}

// Of every function that is called it is known whether it can fail.
int checkImports() {
  int status = 0;
  const KnownImports known = knownImports();
  for (const std::string& import : allImports()) {
    if (known.has(import)) continue;
    printf("FINDING whether %s can fail is not in imports.txt\n", import.c_str());
    status = 1;
  }
  return status;
}

// Every function has a scenario.
int check(const std::vector<Scenario>& scenarios) {
  int status = 0;
  for (const std::string& symbol : symbolsWithoutScenario(scenarios)) {
    printf("FINDING no scenario calls %s\n", demangled(symbol).c_str());
    status = 1;
  }
  for (const std::string& symbol : unknownSymbols(scenarios)) {
    printf("FINDING a scenario names %s, which is not exported\n", symbol.c_str());
    status = 1;
  }
  return status;
}

// Everything that can fail has failed.
int checkFailed() {
  if (!subject::kMakesAllCallsInRuns) return 0;
  int status = 0;
  const std::set<std::string> imports = allImports();
  const std::set<std::string> failed = failedFunctions();
  const KnownImports known = knownImports();
  for (const std::string& function : known.failing) {
    if (!imports.contains(function) || failed.contains(function)) continue;
    if (known.others.contains(function)) continue;
    printf("FINDING no scenario made %s fail\n", function.c_str());
    status = 1;
  }
  return status;
}

}  // namespace

// faults [check | imports | NAME...]: with names only the scenarios whose name begins with one of them.
int main(int count, char** arguments) {
  subject::start(arguments);
  std::vector<Scenario> scenarios = scenarios::all();
  const std::vector<std::string> names(arguments + 1, arguments + count);
  if (names == std::vector<std::string>{"imports"}) return checkImports();
  if (names == std::vector<std::string>{"check"}) return check(scenarios);
  if (names.empty()) {
    keepFailedFunctions();
    const int status = std::max({check(scenarios), checkImports(), runAll(scenarios)});
    return std::max(status, checkFailed());
  }
  std::erase_if(scenarios, [&](const Scenario& scenario) {
    return std::none_of(names.begin(), names.end(),
                        [&](const std::string& name) { return scenario.name.starts_with(name); });
  });
  if (scenarios.empty()) {
    std::cerr << "faults: no scenario has this name\n";
    return kNoScenario;
  }
  return runAll(scenarios);
}
