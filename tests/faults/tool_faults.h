// What the driver of the tool and the object that it preloads into the tool share.
#pragma once

#include <stddef.h>

#include <iterator>

#include "kinds.h"

// The kinds are numbered as in kKindsOfCall; the next number is every call but those whose failure
// cannot be reported.
constexpr size_t kAnyKind = std::size(kKindsOfCall);
constexpr size_t kKinds = kAnyKind + 1;

// Set for the tool: "KIND ERROR NTH TIMES", all numbers. The nth call of that kind fails with the
// error, and TIMES - 1 further ones.
constexpr const char* kFaultVariable = "OSUTILS_TOOL_FAULT";
// Set for the tool: the file that the report is written to when the tool ends.
constexpr const char* kReportVariable = "OSUTILS_TOOL_FAULT_REPORT";

struct FaultReport {
  bool fired;
  int calls[kKinds];    // counted only without a fault
  char functions[160];  // that failed
};
