// A function with two LTTng-UST tracepoints that are off, and a pair of events that are recorded.
#define LTTNG_UST_TRACEPOINT_CREATE_PROBES
#define LTTNG_UST_TRACEPOINT_DEFINE
#include "lttng_events.h"

#include "trace_numbers.h"

namespace {

constexpr uint32_t kFunction = trace::functionId(4, 1);

}  // namespace

#define EXPORTED extern "C" __attribute__((visibility("default")))

EXPORTED int with_tracepoints_off(int argument) {
  lttng_ust_tracepoint(osutils_bench, off_entry, trace::kEntry33, kFunction, nullptr);
  lttng_ust_tracepoint(osutils_bench, off_exit, trace::kExit33, kFunction, nullptr, argument);
  return argument;
}

EXPORTED void record_entry_and_exit(int64_t code) {
  lttng_ust_tracepoint(osutils_bench, recorded_entry, trace::kEntry33, kFunction, nullptr);
  lttng_ust_tracepoint(osutils_bench, recorded_exit, trace::kExit33, kFunction, nullptr, code);
}

EXPORTED void record_bare_entry_and_exit(int64_t code) {
  lttng_ust_tracepoint(osutils_bench, bare_entry, trace::kEntry33, kFunction, nullptr);
  lttng_ust_tracepoint(osutils_bench, bare_exit, trace::kExit33, kFunction, nullptr, code);
}

EXPORTED bool records_bare_events() {
  return lttng_ust_tracepoint_enabled(osutils_bench, bare_entry) &&
         lttng_ust_tracepoint_enabled(osutils_bench, bare_exit);
}

EXPORTED bool is_enabled(const void* tracepoint) {
  return static_cast<const struct lttng_ust_tracepoint*>(tracepoint)->state != 0;
}

EXPORTED bool records_events() {
  return lttng_ust_tracepoint_enabled(osutils_bench, recorded_entry) &&
         lttng_ust_tracepoint_enabled(osutils_bench, recorded_exit);
}

EXPORTED bool tracepoints_are_off() {
  return !lttng_ust_tracepoint_enabled(osutils_bench, off_entry) &&
         !lttng_ust_tracepoint_enabled(osutils_bench, off_exit);
}
