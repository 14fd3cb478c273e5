// Runs one scenario for a driver that lets its system calls fail or changes its surroundings.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <iostream>
#include <iterator>
#include <string>
#include <vector>

#include "scenario.h"

namespace {

using scenarios::Scenario;

constexpr int kResultDescriptor = 250;  // what the functions open and print does not mix with it

const char* const kUsage =
    "usage: run_scenario list\n"
    "       run_scenario prepare NAME DIRECTORY\n"
    "       run_scenario run [--stop] NAME DIRECTORY\n"
    "       run_scenario judge [--good] NAME DIRECTORY [RESULT]\n"
    "\n"
    "`prepare` needs an empty directory. `run` prints the result; with --stop it stops itself "
    "with\n"
    "SIGSTOP right before the call. `judge` prints what is wrong with the result and the state\n"
    "after a failure of any kind, or after none with --good, and ends with 1; otherwise it ends\n"
    "with 0. It reads a result that is no argument from standard input.\n";

int prepare(const Scenario& scenario) {
  scenario.prepare();
  return 0;
}

// A system call for the result that fails once is repeated.
bool print(const std::string& result) {
  int failures = 0;
  for (size_t written = 0; written < result.size();) {
    const ssize_t size = write(kResultDescriptor, result.data() + written, result.size() - written);
    if (size < 0 && ++failures > 1) return false;
    if (size > 0) written += static_cast<size_t>(size);
  }
  return true;
}

[[noreturn]] void run(const Scenario& scenario, bool stops) {
  if (dup3(STDOUT_FILENO, kResultDescriptor, O_CLOEXEC) == -1 ||
      dup2(STDERR_FILENO, STDOUT_FILENO) == -1) {
    perror("run_scenario");
    _exit(2);
  }
  if (stops) kill(getpid(), SIGSTOP);
  const std::string result = scenario.run();
  _exit(print(result) ? 0 : 2);
}

int judge(Scenario scenario, bool is_good, const std::string& result) {
  // Only the process of the run could have counted this.
  for (scenarios::End& end : scenario.ends) end.left = {};
  const std::string finding =
      scenarios::judge(scenario, is_good ? scenarios::kNothing : scenarios::kAnything,
                       {result, scenario.state(), {}});
  if (finding.empty()) return 0;
  std::cout << finding << "\n";
  return 1;
}

std::string standardInput() { return std::string(std::istreambuf_iterator<char>(std::cin), {}); }

int list(const std::vector<Scenario>& scenarios) {
  for (const Scenario& scenario : scenarios) std::cout << scenario.name << "\n";
  return 0;
}

int wrongUsage() {
  std::cerr << kUsage;
  return 2;
}

}  // namespace

int main(int count, char** arguments) {
  std::vector<std::string> words(arguments + 1, arguments + count);
  const std::vector<Scenario> scenarios = scenarios::all();
  if (words == std::vector<std::string>{"list"}) return list(scenarios);
  if (words.empty()) return wrongUsage();
  const std::string command = words[0];
  words.erase(words.begin());
  const bool has_option = !words.empty() && words[0] == (command == "run" ? "--stop" : "--good");
  if (has_option && command != "prepare") words.erase(words.begin());
  const bool has_result = command == "judge" && words.size() == 3;
  if (words.size() != 2 && !has_result) return wrongUsage();

  const auto scenario = std::find_if(scenarios.begin(), scenarios.end(),
                                     [&](const Scenario& each) { return each.name == words[0]; });
  if (scenario == scenarios.end()) {
    std::cerr << "run_scenario: no scenario has the name " << words[0] << "\n";
    return 2;
  }
  scenarios::setDirectory(words[1]);
  if (command == "prepare") return prepare(*scenario);
  if (command == "run") run(*scenario, has_option);
  if (command == "judge")
    return judge(*scenario, has_option, has_result ? words[2] : standardInput());
  return wrongUsage();
}
