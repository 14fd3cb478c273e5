// LTTng-UST events with the fields of our entry and exit records.
#undef LTTNG_UST_TRACEPOINT_PROVIDER
#define LTTNG_UST_TRACEPOINT_PROVIDER osutils_bench

#undef LTTNG_UST_TRACEPOINT_INCLUDE
#define LTTNG_UST_TRACEPOINT_INCLUDE "lttng_events.h"

#if !defined(LTTNG_EVENTS_H) || defined(LTTNG_UST_TRACEPOINT_HEADER_MULTI_READ)
#define LTTNG_EVENTS_H

#include <lttng/tracepoint.h>
#include <stdint.h>

// clang-format off
LTTNG_UST_TRACEPOINT_EVENT_CLASS(osutils_bench, without_code,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_integer_hex(uint32_t, type, type)
    lttng_ust_field_integer_hex(uint32_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))))

LTTNG_UST_TRACEPOINT_EVENT_CLASS(osutils_bench, with_code,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object, int64_t, code),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_integer_hex(uint32_t, type, type)
    lttng_ust_field_integer_hex(uint32_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))
    lttng_ust_field_integer(int64_t, code, code)))

// The session of the flight recorder enables these.
LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(osutils_bench, without_code, osutils_bench, recorded_entry,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object))
LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(osutils_bench, with_code, osutils_bench, recorded_exit,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object, int64_t, code))

// The fields of the trace library on LTTng. The session of the flight recorder enables these, too.
LTTNG_UST_TRACEPOINT_EVENT(osutils_bench, bare_entry,
  LTTNG_UST_TP_ARGS(uint64_t, type, uint64_t, id, const void*, object),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_integer_hex(uint64_t, type, type)
    lttng_ust_field_integer_hex(uint64_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))))
LTTNG_UST_TRACEPOINT_EVENT(osutils_bench, bare_exit,
  LTTNG_UST_TP_ARGS(uint64_t, type, uint64_t, id, const void*, object, int64_t, code),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_integer_hex(uint64_t, type, type)
    lttng_ust_field_integer_hex(uint64_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))
    lttng_ust_field_integer(int64_t, code, code)))

// No session enables these.
LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(osutils_bench, without_code, osutils_bench, off_entry,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object))
LTTNG_UST_TRACEPOINT_EVENT_INSTANCE(osutils_bench, with_code, osutils_bench, off_exit,
  LTTNG_UST_TP_ARGS(uint32_t, type, uint32_t, id, const void*, object, int64_t, code))
// clang-format on

#endif

#include <lttng/tracepoint-event.h>
