// What every command of the tool does in each of its main variants, for the driver that runs it while
// calls fail.
#pragma once

#include <sys/types.h>

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "scenario.h"

// What a run works on.
struct World {
  std::string directory;
  std::vector<pid_t> processes;  // of the scenario, ended by the driver
};

struct ToolScenario {
  std::string command;  // "services add"
  std::string variant;
  // In all of these, "@" stands for the directory, and "PID" for the first process.
  std::vector<std::string> words;
  int status = 0;  // without a fault
  std::function<void(World&)> prepare = [](World&) {};
  std::vector<std::string> environment = {};  // "NAME=value"
  std::string input = {};
  // Whether a failure may leave the directory like this, neither as it was nor as after success. Lock
  // files are not among the names.
  std::function<bool(const std::map<std::string, std::string>& state, const std::string& message)>
      may_leave = {};
  // The commands after which the next run puts things right.
  std::vector<std::vector<std::string>> repair = {};
  // Kinds of failure after which the output and the answer may differ, because the library returns the
  // same as for something else.
  scenarios::Kinds may_mislead = 0;
  bool ends_process = false;
  bool has_varying_numbers = false;
  bool is_verbose = false;        // standard error also has what did not fail
  bool has_common_calls = false;  // also fails those that all commands make
};

std::vector<ToolScenario> toolScenarios();

// What `process start` runs: writes its arguments and its open descriptors into the file "started".
int launcher(int count, char** arguments);
