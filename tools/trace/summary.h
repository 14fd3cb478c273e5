// What each function did, for several views.
#pragma once

#include <memory>

#include "calls.h"
#include "command.h"

namespace traces {

class FunctionSummary : public Visitor {
 public:
  // The functions of `trace summary --json`.
  virtual Answer rows() const = 0;
};

std::unique_ptr<FunctionSummary> makeFunctionSummary();

}  // namespace traces
