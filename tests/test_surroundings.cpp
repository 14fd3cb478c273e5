// Every scenario in surroundings that are really hostile, with the real shared objects: plain, and with
// everything traced and printed.
//
// The test starts itself once for each surrounding: the switches are read when a program starts, and
// the names of what the surroundings hide are needed until then.

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <ldtr.h>
#include <netdb.h>
#include <pwd.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <bit>
#include <exception>
#include <filesystem>
#include <iostream>
#include <new>
#include <stdexcept>
#include <string>
#include <vector>

#include "library_blocks.h"
#include "scenario.h"
#include "surroundings.h"
#include "world.h"

namespace {

using scenarios::Outcome;
using scenarios::Scenario;
using surroundings::Disk;
using surroundings::StandardFiles;
using surroundings::Surrounding;

constexpr unsigned kTimeLimit = 60;  // seconds, for one run

// What a run in a process of its own reports.
struct Report {
  bool is_surrounded;
  bool is_judged;
  char outcome[8192];
  char finding[8192];
};

void set(char (&text)[8192], const std::string& value) {
  text[value.copy(text, sizeof text - 1)] = '\0';
}

void traceEverything(const Disk& disk) {
  (void)setenv("TRC_DIR", disk.traces.c_str(), 1);
  (void)setenv("TRC_EVENTS", "all", 1);
  (void)ldtr_init();
}

// In a process without memory, the first look-up ends in the C library (glibc 2.36) with SIGSEGV.
void useTheLookUps() {
  (void)getpwnam("root");
  (void)getgrnam("root");
  addrinfo* addresses = nullptr;
  if (getaddrinfo("localhost", nullptr, nullptr, &addresses) == 0) freeaddrinfo(addresses);
}

// As docs/compatibility.md says.
bool printsOnStandardError(const Scenario& scenario) {
  return std::any_of(scenario.symbols.begin(), scenario.symbols.end(), [](const auto& symbol) {
    return symbol == "getAllIPAddresses_Linux" || symbol == "isValidIPAddressOnSystem" ||
           symbol == "getXQ4PathAndVersion" || symbol == "deleteDirForcefully" ||
           symbol == "isProcessStarted" || symbol == "startProcess" || symbol == "isValidUser" ||
           symbol == "_Z6isNPTLv";
  });
}

class Runner {
 public:
  Runner(const Surrounding& surrounding, const Disk& disk, std::string directory)
      : surrounding_(surrounding),
        disk_(disk),
        files_(std::move(directory)),
        report_(*static_cast<Report*>(mmap(nullptr, sizeof(Report), PROT_READ | PROT_WRITE,
                                           MAP_SHARED | MAP_ANONYMOUS, -1, 0))) {}

  // Runs the scenario plain and traced. Returns what was wrong.
  std::string findings(const Scenario& scenario) {
    const std::string plain = finding(scenario, false);
    const Report untraced = report_;
    const std::string traced = finding(scenario, true);
    std::string all;
    if (!plain.empty()) all += scenario.name + ": " + plain + "\n";
    if (!traced.empty()) all += scenario.name + ", traced: " + traced + "\n";
    if (all.empty() && !mayDiffer(scenario) && strcmp(untraced.outcome, report_.outcome) != 0) {
      all +=
          scenario.name + ": traced " + report_.outcome + ", otherwise " + untraced.outcome + "\n";
    }
    judged_ += report_.is_judged && untraced.is_judged ? 1 : 0;
    return all;
  }
  int judged() const { return judged_; }

 private:
  // The memory and the descriptors of the trace are no longer there for the call. The result of
  // ldtr_init is about the trace itself.
  bool mayDiffer(const Scenario& scenario) const {
    return surrounding_.limits_memory || surrounding_.few_descriptors ||
           scenario.symbols.front() == "_Z9ldtr_initv";
  }

  std::string finding(const Scenario& scenario, bool is_traced) {
    report_ = {};
    clear(disk_);
    const pid_t child = fork();
    if (child == 0) {
      (void)alarm(kTimeLimit);
      runInChild(scenario, is_traced);
      _exit(0);
    }
    int status = 0;
    while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
    }
    if (report_.is_surrounded) surrounding_.leave(disk_);
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    if (WIFSIGNALED(status)) {
      if (WTERMSIG(status) == SIGXFSZ && surrounding_.ends_writers) return "";
      return WTERMSIG(status) == SIGALRM ? "does not end" : strsignal(WTERMSIG(status));
    }
    if (WEXITSTATUS(status) != 0) return "ended with " + std::to_string(WEXITSTATUS(status));
    return report_.finding;
  }

  void runInChild(const Scenario& scenario, bool is_traced) {
    scenarios::setDirectory(disk_.work);
    scenario.prepare();
    handOver(surrounding_, disk_);
    if (!files_.open()) {
      set(report_.finding, "cannot open the files of the program");
      return;
    }
    if (is_traced) traceEverything(disk_);
    if (surrounding_.limits_memory) useTheLookUps();
    const int descriptors = openDescriptors();
    const int blocks = libraryBlocks();
    surrounding_.enter(disk_);
    report_.is_surrounded = true;
    Outcome outcome;
    try {
      outcome.result = scenario.run();
      report_.is_judged = true;
    } catch (
        const std::
            exception&) {  // of the scenario itself, which needed memory, a descriptor or a process
    }
    surrounding_.leave(disk_);
    report_.is_surrounded = false;
    if (!report_.is_judged) return;
    outcome.left = {
        .blocks = libraryBlocks() - blocks,
        .descriptors = openDescriptors() - descriptors + std::popcount(surrounding_.closed)};
    outcome.state = scenario.state();
    set(report_.outcome, outcome.result + ", state " + outcome.state);
    std::string finding = judge(scenario, scenarios::kAnything, outcome);
    finding += files_.changes(printsOnStandardError(scenario));
    if (finding.empty() && !is_traced && scenario.repeatable && !surrounding_.is_remembered) {
      finding = nextCall(scenario);
    }
    set(report_.finding, finding);
  }

  // A failure must not spoil the next call.
  std::string nextCall(const Scenario& scenario) const {
    const std::string directory = disk_.path + "/next";
    (void)mkdir(directory.c_str(), 0755);
    scenarios::setDirectory(directory);
    scenario.prepare();
    const std::string result = scenario.run();
    const std::string finding =
        judge(scenario, scenarios::kNothing, {result, scenario.state(), {}});
    return finding.empty() ? "" : "the next call: " + finding;
  }

  const Surrounding& surrounding_;
  const Disk& disk_;
  const StandardFiles files_;
  Report& report_;
  int judged_ = 0;
};

Surrounding named(const std::string& name) {
  for (const Surrounding& each : surroundings::all()) {
    if (each.name == name) return each;
  }
  throw std::invalid_argument(name);
}

bool holds(const Surrounding& surrounding, const Disk& disk) {
  clear(disk);
  handOver(surrounding, disk);
  const int result = inChild([&] {
    surrounding.enter(disk);
    const bool held = surrounding.holds(disk);
    surrounding.leave(disk);
    return held ? 0 : 1;
  });
  return result == 0;
}

// Runs all scenarios in the surrounding and prints what was wrong.
int runIn(const Surrounding& surrounding, const std::string& path) {
  const Disk disk = {path, path + "/work", path + "/traces"};
  if (!holds(surrounding, disk)) {
    std::cout << "the surrounding has no effect\n";
    return 1;
  }
  Runner runner(surrounding, disk, std::filesystem::path(path).parent_path());
  const std::vector<Scenario> scenarios = scenarios::all();
  bool found = false;
  for (const Scenario& scenario : scenarios) {
    const std::string findings = runner.findings(scenario);
    std::cout << findings;
    found = found || !findings.empty();
  }
  const auto expected = std::ssize(scenarios);
  std::cout << runner.judged() << " of " << expected << " scenarios judged\n";
  // Scenarios stop where they need memory, descriptors or processes themselves.
  const bool may_stop = surrounding.limits_memory || surrounding.few_descriptors ||
                        surrounding.user != 0 || surrounding.ends_writers;
  const auto least = may_stop ? expected * 2 / 5 : expected;
  return found || runner.judged() < least ? 1 : 0;
}

constexpr char kOption[] = "--surrounding=";

class Surroundings : public testing::TestWithParam<std::string> {};

TEST_P(Surroundings, AllowOnlyTheRequiredResults) {
  REQUIRE_ROOT("for namespaces of its own");
  const std::string program = std::filesystem::read_symlink("/proc/self/exe").string();
  const TempDir temp;
  const std::string out = temp.path("out");
  EXPECT_EQ(surroundings::withDisk([&](const Disk& disk) {
              const Surrounding surrounding = named(GetParam());
              std::string command;
              if (!surrounding.few_descriptors) command += "PRINT_DEBUG=all ";
              if ((surrounding.closed & (1U << STDERR_FILENO)) == 0) {
                command += "PRINT_DEBUG_FILE='" + temp.path("printed") + "' ";
              }
              close_range(STDERR_FILENO + 1, ~0U, 0);
              command += "'" + program + "' " + kOption + GetParam() + " '" + disk.path + "' >'" +
                         out + "' 2>&1";
              return system(command.c_str()) == 0 ? 0 : 1;
            }),
            0)
      << contentsOf(out);
  printf("%s", contentsOf(out).c_str());
}

std::vector<std::string> names() {
  std::vector<std::string> names;
  for (const Surrounding& each : surroundings::all()) names.push_back(each.name);
  return names;
}

INSTANTIATE_TEST_SUITE_P(Of, Surroundings, testing::ValuesIn(names()),
                         [](const auto& each) { return each.param; });

}  // namespace

int main(int argc, char** argv) {
  const size_t option = strlen(kOption);
  if (argc == 3 && strncmp(argv[1], kOption, option) == 0) {
    return runIn(named(argv[1] + option), argv[2]);
  }
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
