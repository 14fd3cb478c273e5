// What every exported function does in each of its main variants, for programs that run it while
// calls fail.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace scenarios {

// The kinds of call that can fail, as bits.
enum Kind : unsigned {
  kMemory = 1 << 0,
  kOpen = 1 << 1,
  kRead = 1 << 2,
  kWrite = 1 << 3,  // also of the size of a file
  kClose = 1 << 4,
  kStatus = 1 << 5,
  kOwner = 1 << 6,      // owner, group and mode
  kDirectory = 1 << 7,  // directories, links and names
  kLock = 1 << 8,       // files and mutexes
  kProcess = 1 << 9,    // processes, pipes and shells
  kNetwork = 1 << 10,
  kLookup = 1 << 11,  // accounts and hosts
  kMapping = 1 << 12,
  kSync = 1 << 13,
  kClock = 1 << 14,
  kLibrary = 1 << 15,  // the dynamic loader
  kEnvironment = 1 << 16,
  kPrint = 1 << 17,  // print and copy functions, most of them the platform's
  kTrace = 1 << 18,  // the platform's trace functions
  kShell = 1 << 19,  // within a shell command, where no call of the library shows it
};
using Kinds = unsigned;
constexpr Kinds kNothing = 0;
constexpr Kinds kAnything = ~0U;

// What is left after a run, beyond the world outside the process.
struct Left {
  int blocks = 0;       // of memory that the library allocated
  int descriptors = 0;  // that were not open before
  bool operator==(const Left&) const = default;
};

// An exact text, or a condition that a text must meet.
class Expected {
 public:
  Expected(const char* text) : Expected(std::string(text)) {}
  Expected(std::string text);
  Expected(std::function<bool(const std::string&)> condition) : matches_(std::move(condition)) {}
  bool matches(const std::string& text) const { return matches_(text); }

 private:
  std::function<bool(const std::string&)> matches_;
};

// A way in which a run may end after a failure of one of the kinds in `after`.
struct End {
  Kinds after;
  Expected result;
  Expected state = "";
  Left left = {};
};

struct Scenario {
  std::string name;                  // what is called, and how
  std::vector<std::string> symbols;  // as in packaging/exported_symbols.txt
  // Makes what the call works on, in an empty directory whose names path() returns.
  std::function<void()> prepare = [] {};
  // Calls the function, frees what it returned, and returns all of that as text.
  std::function<std::string()> run;
  // Returns what the call has changed outside the process, as text.
  std::function<std::string()> state = [] { return std::string(); };
  // The first is that of a run in which nothing fails. It is allowed after any failure too, because
  // the work is done then, except after failures that are always reported.
  std::vector<End> ends;
  // Failures of these kinds are always reported.
  Kinds reported = kNothing;
  // Calls of these kinds are repeated until they succeed.
  Kinds repeated = kNothing;
  // False for a function whose next call in the same process uses what the first has found out.
  bool repeatable = true;
};

// What a run did.
struct Outcome {
  std::string result;
  std::string state;
  std::optional<Left> left = {};  // if it was measured
};

std::vector<Scenario> all();

// Each family's own.
std::vector<Scenario> accountScenarios();
std::vector<Scenario> directoryScenarios();
std::vector<Scenario>
environmentScenarios();  // and the installation layout, the database, the time
std::vector<Scenario> fileScenarios();
std::vector<Scenario> hostScenarios();  // ldap_clientosutils.h
std::vector<Scenario> inittabScenarios();
std::vector<Scenario> libraryScenarios();
std::vector<Scenario> nameScenarios();  // screening, distinguished names
std::vector<Scenario> networkScenarios();
std::vector<Scenario> processScenarios();
std::vector<Scenario> servicesScenarios();
std::vector<Scenario> traceScenarios();  // ldtr.h

// The functions of packaging/exported_symbols.txt that no scenario calls, and the symbols of
// scenarios that are not exported.
std::vector<std::string> symbolsWithoutScenario(const std::vector<Scenario>& scenarios);
std::vector<std::string> unknownSymbols(const std::vector<Scenario>& scenarios);

// The directory of the run, and a name in it. The text lives as long as the program.
void setDirectory(const std::string& directory);
char* path(const std::string& name);

// Returns /etc/NAME. Throws unless /etc is a private copy.
std::string etcFile(const std::string& name);

std::string text(const Left& left);

// Returns what was wrong with the outcome after failures of these kinds; nothing if it is allowed.
std::string judge(const Scenario& scenario, Kinds failed, const Outcome& outcome);

// ---- Set by programs that replace the platform's functions ----

// The records and messages that these got during the run, one text each.
extern std::function<std::vector<std::string>()> written;
// Called instead of each wait of the library; set by the scenario.
extern std::function<void()> instead_of_waiting;

// ---- For writing scenarios ----

// The function always reports failures of these kinds, in every scenario that has an end for them.
void alwaysReports(std::vector<Scenario>& all, const std::string& symbol, Kinds kinds);
// A new string that the library returned: its text in quotes, or "null". Frees it.
std::string freed(char* text);
// A list that the library returned: its texts in parentheses, or "null". Frees it.
std::string freed(char** list);
// What was written, in parentheses, or "unseen"; and what it must be if it is seen.
std::string shownWritten();
Expected writes(std::vector<std::string> texts);
std::string shown(bool value);
std::string shown(int value);
// "missing", "directory", "-> TARGET" for a link, or the mode and the contents of a file: "644 text".
std::string shownFile(const std::string& name);
// The names of owner and group, then what shownFile() returns: "root:root 644 text". For a directory
// its mode too: "root:root 755 directory".
std::string shownOwned(const std::string& name);
// Makes a file with these contents and this mode.
void makeFile(const std::string& name, const std::string& contents, unsigned int mode = 0644);
// Calls with the umask 022. Returns the result and the umask after the call: "true, umask 26".
std::string withUmask(const std::function<std::string()>& call);

}  // namespace scenarios
