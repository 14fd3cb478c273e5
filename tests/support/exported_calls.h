// A call of every exported function, for tests of what all functions have in common.
#pragma once

#include <functional>
#include <string>
#include <vector>

// The subsystem outside the library that a function depends on.
enum class Enters { kNothing, kAccounts, kResolver, kShell };

// What other threads may do during a call. The services and inittab files have one path for the
// whole process and are not locked, nor is the environment.
enum class Meanwhile { kAnything, kNoEdit, kNoUseOfEditedFiles, kNoCall };

struct ExportedCall {
  // The symbols as in packaging/exported_symbols.txt; "*" at the end stands for the rest of a name
  // that depends on the architecture.
  std::vector<std::string> symbols;
  Enters enters;
  // Calls the function, also with a failure if it has a specific one, and frees the result. Returns
  // whether the results were right. It allocates nothing, uses little stack and is not a cancellation
  // point itself, so all of these come from the library.
  std::function<bool()> body;
  Meanwhile meanwhile = Meanwhile::kAnything;
  bool once = false;  // takes or makes a file, so the directory must be filled again after the call
};

// The calls work in `directory`. prepareCalls() fills it again before each call, and points the library to it.
// fillCalls() and useCalls() do one of the two; useCalls() sets the environment.
// Only one directory can be in use for the services and inittab files and as the install root.
std::vector<ExportedCall> exportedCalls(const std::string& directory);
void prepareCalls(const std::string& directory);
void fillCalls(const std::string& directory);
void useCalls(const std::string& directory);
void fillEditedFiles(const std::string& directory);

// The functions of packaging/exported_symbols.txt that no call covers.
std::vector<std::string> symbolsWithoutCall(const std::vector<ExportedCall>& calls);
