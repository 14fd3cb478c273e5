// What runs under strace: every command of the tool, and every scenario of the exported functions.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "strace_run.h"

struct Subject {
  std::string row;  // of the table: the command or the function
  std::string name;
  bool is_edit;
  bool is_function;  // the scenario makes calls of its own, which count for nothing
  Words program;
  Words environment;
  std::function<void()> prepare;       // in an empty directory
  std::function<std::string()> state;  // what the program has changed
  // Returns what was wrong with a run, or nothing. `good` is the run in which nothing failed, and
  // `state` what it left.
  std::function<std::string(const Ended& ended, const Ended& good, const std::string& state)> judge;
};

// The programs work in the directory, which is emptied before each run; the drivers' own files are in
// `scratch`.
std::vector<Subject> commandSubjects(const std::string& directory, const std::string& scratch);
std::vector<Subject> functionSubjects(const std::string& directory, const std::string& scratch);

// The commands that the tool has and no subject runs.
Words commandsWithoutSubject(const std::vector<Subject>& subjects, const std::string& scratch);

// For the environment of every program.
inline const Words kEnvironment = {"LC_ALL=C.UTF-8", "TZ=UTC0"};
