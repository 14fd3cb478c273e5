// A call of every exported function, for tests that ask the same of all of them.
#pragma once

#include <functional>
#include <string>
#include <vector>

// What a function needs that no promise of ours covers.
enum class Enters { kNothing, kAccounts, kResolver, kShell };

struct ExportedCall {
  // The symbols as in packaging/exported_symbols.txt; "*" at the end stands for the rest of a name
  // that depends on the architecture.
  std::vector<std::string> symbols;
  Enters enters;
  // Calls the function, where it has a failure of its own also for that, and releases what it gave.
  // True when the answers were right. Needs little stack, allocates nothing, and is no cancellation
  // point: what happens in it happens in the library.
  std::function<bool()> body;
};

// The calls work in `directory`, which prepareCalls() fills anew before each of them. useCalls() is
// enough in a process that finds it filled.
std::vector<ExportedCall> exportedCalls(const std::string& directory);
void prepareCalls(const std::string& directory);
void useCalls(const std::string& directory);

// The functions of packaging/exported_symbols.txt that none of the calls has.
std::vector<std::string> symbolsWithoutCall(const std::vector<ExportedCall>& calls);
