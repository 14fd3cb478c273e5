// The scope that every traced function opens in its first line, and the debug messages in it.
#pragma once

#include "ldtr.h"
#include "trace_numbers.h"

// In front of every traced function: the stack protector would read its guard value, on x86-64 a
// thread-local, at every call, even with tracing off.
#define TRACED __attribute__((no_stack_protector))

namespace osutils {

// What the record of a function says about it.
struct TracedFunction {
  unsigned long id;
  unsigned long trace_class;
};

namespace traced {
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  inline constexpr TracedFunction identifier{trace::functionId(module, ordinal), trace_class};
#include "trace_functions.def"
#undef TRACE_FUNCTION
}  // namespace traced

// Writes the entry record now and the exit record on every way out. With tracing off the
// constructor and the destructor are one bit test each.
template <TracedFunction Function>
class TraceScope {
 public:
  TraceScope() : scope_(nullptr) {
    if (ldtr_traces(kMask)) scope_(ldtr_entry_type(Function.trace_class))();
  }

  // Stores the code for the exit record and returns it, so that the record cannot differ from what
  // the caller gets. A flag is recorded as 1 or 0.
  template <typename Code>
  Code result(Code code) {
    scope_.SetErrorCode(static_cast<long>(code));
    return code;
  }

  ldtr_formater_local operator()(unsigned long type) { return scope_(type); }

 private:
  static_assert(Function.trace_class == 33 || Function.trace_class == 43);
  static constexpr unsigned long kMask =
      Function.trace_class == 33 ? LDTR_EVENT_CLASS_33 : LDTR_EVENT_CLASS_43;

  ldtr_function_local<Function.id, Function.trace_class, kMask> scope_;
};

}  // namespace osutils

// Writes a debug message through `trace`, a TraceScope or ldtr_fun. A macro, because its arguments
// must not be evaluated unless debug tracing is on.
#define DEBUG_MESSAGE_AT(trace, level, ...)                                                \
  do {                                                                                     \
    if (ldtr_traces(LDTR_EVENT_DEBUG)) (trace)(LDTR_TYPE_DEBUG).debug(level, __VA_ARGS__); \
  } while (false)
#define DEBUG_MESSAGE(trace, ...) DEBUG_MESSAGE_AT(trace, LDTR_LEVEL_ORDINARY, __VA_ARGS__)
#define ERROR_MESSAGE(trace, ...) DEBUG_MESSAGE_AT(trace, LDTR_LEVEL_ERROR, __VA_ARGS__)
