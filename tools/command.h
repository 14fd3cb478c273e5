// What the command families share: how a command is added, how it answers and how it fails.
#pragma once

#include <CLI/CLI.hpp>
#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
#include <stdexcept>
#include <string>

// An object, or a list of objects with the same keys. It is printed as it is for scripts, and as a table
// with the keys as its headings for people, so that both always say the same.
using Answer = nlohmann::ordered_json;

// The command that the arguments ask for, and the options that every command has.
struct Chosen {
  std::function<Answer()> run;
  bool json = false;
  std::optional<std::string> trace_directory;
};

// Adds a command to a family. `run` is called after all arguments were understood; nothing is printed
// before it has returned.
CLI::App& addCommand(CLI::App& family, Chosen& chosen, const char* name, const char* description,
                     const std::function<Answer()>& run);

// The one line that a failed command leaves on standard error, less the command's name.
class Failure : public std::runtime_error {
 public:
  // For functions that answer a result code: "no such object (32): what".
  Failure(int code, const std::string& what);
  // For functions that answer only yes or no, or -1: what failed, and what checkFilePerms answers for
  // the file that was asked about.
  Failure(const std::string& what, const std::string& path);
};

// One function for each family.
void addServicesCommands(CLI::App& tool, Chosen& chosen);
