// Whose calls the fault driver makes fail: those of libosutils.so, or those of the platform libraries.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "kinds.h"

namespace subject {

// Called first in main(), with its arguments.
void start(char** arguments);

// The shared objects whose calls fail: the beginnings of their files' names.
std::vector<std::string> callers();

// What the caller of the library may see of a failure of this kind.
scenarios::Kinds effectsOf(const KindOfCall& kind);

// Switches tracing on for a run of the scenario.
class Tracing {
 public:
  explicit Tracing(const scenarios::Scenario& scenario);
  ~Tracing();
  Tracing(const Tracing&) = delete;
  Tracing& operator=(const Tracing&) = delete;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

// Whether a run leaves what its end of the scenario says; otherwise it leaves at most as much as any end,
// or as a run without a fault.
extern const bool kLeavesAsInScenario;

// Whether all calls are made in runs; otherwise some are made only when a library is loaded.
extern const bool kMakesAllCallsInRuns;

// Removes what tracing has made in the process with this number.
void removeTrace(int process);

}  // namespace subject
