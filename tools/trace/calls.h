// The calls in traces, read through libbabeltrace2. Memory grows with the threads and the functions of a trace and with
// the calls that are open at one time, not with its records.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <functional>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "trace_numbers.h"

namespace traces {

// What a trace does not say is empty or 0.
struct Process {
  std::string host;
  std::string program;
  int64_t id = 0;
};

struct Thread {
  const Process* process = nullptr;
  uint64_t id = 0;
};

struct Function {
  std::string name;                         // the number in hexadecimal if nothing names it
  std::optional<trace::Recorded> recorded;  // none: not in the table of traced functions
  size_t index = 0;                         // 0, 1, ... in the order in which functions appear
};

enum class Failed { kNo, kYes, kUnknown };

// Times are nanoseconds since 1970 in UTC.
struct Call {
  const Thread* thread = nullptr;
  const Function* function = nullptr;
  int64_t begin = 0;
  int64_t end = 0;         // without an exit the latest time of the thread's records
  int64_t children = 0;    // time in the traced calls that it made
  unsigned depth = 0;      // number of calls around it
  bool has_entry = false;  // without one, begin is end
  bool has_exit = false;
  std::optional<int64_t> code;
  Failed failed = Failed::kUnknown;

  int64_t total() const { return end - begin; }
  int64_t own() const { return total() - children; }
};

struct Message {
  const Thread* thread = nullptr;
  const Function* function = nullptr;
  int64_t time = 0;
  unsigned depth = 0;  // number of calls around it
  bool is_error = false;
  std::string_view text;  // as recorded: may hold control characters and invalid UTF-8
};

// Told of one thread's calls and messages in the order of time. Records of several threads may be mixed, or come one
// thread after the other. Calls and texts are valid until the function returns; threads, processes and functions as
// long as the Reading.
class Visitor {
 public:
  virtual ~Visitor() = default;
  virtual void begin(const Call&) {}
  virtual void end(const Call&) {}  // the only one for an exit without an entry
  virtual void message(const Message&) {}
};

using Names = std::map<uint64_t, std::string>;

struct Reading {
  uint64_t traces = 0;  // folders that could be read, also in part
  uint64_t records = 0;
  uint64_t again = 0;  // of these not later than the latest of their thread in the first reading
  uint64_t discarded = 0;   // records that the tracer says are missing
  uint64_t foreign = 0;     // events that are not those of traced functions
  uint64_t unreadable = 0;  // stream files, or whole traces, that could not be read, also in part
  std::vector<std::string> problems;  // a line for each of the first of them
  std::shared_ptr<const void> kept;   // threads, processes and functions
};

struct Settings {
  Names names;  // before those of the table and of the trace
  // Calls that begin, and messages, at or after `from` and before `to`.
  int64_t from = std::numeric_limits<int64_t>::min();
  int64_t to = std::numeric_limits<int64_t>::max();
  // Called about every 65,536 records with the number so far, and which part of the trace is read, if known.
  std::function<void(uint64_t records, std::optional<double> part)> progress;
  const Reading* first = nullptr;  // an earlier reading of the same paths
};

// Reads the traces in all folders at or below the paths.
Reading read(const std::vector<std::string>& paths, const Settings& settings, Visitor& visitor);

}  // namespace traces
