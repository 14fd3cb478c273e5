// The events that LTTng-UST records, with the fields of libtrc's own traces. LTTng-UST's macros read this file several
// times.
#undef LTTNG_UST_TRACEPOINT_PROVIDER
#define LTTNG_UST_TRACEPOINT_PROVIDER osutils

#undef LTTNG_UST_TRACEPOINT_INCLUDE
#define LTTNG_UST_TRACEPOINT_INCLUDE "events.h"

#if !defined(OSUTILS_LTTNG_EVENTS_H) || defined(LTTNG_UST_TRACEPOINT_HEADER_MULTI_READ)
#define OSUTILS_LTTNG_EVENTS_H

#include <lttng/tracepoint.h>
#include <stdint.h>

// clang-format off
LTTNG_UST_TRACEPOINT_ENUM(osutils, type, LTTNG_UST_TP_ENUM_VALUES(TRACE_TYPES))
LTTNG_UST_TRACEPOINT_ENUM(osutils, function, LTTNG_UST_TP_ENUM_VALUES(
  TRACE_FUNCTIONS
  TRACE_RANGE("ldtr_fun", uint64_t{trace::kOrdinaryLevel})
  TRACE_RANGE("ldtr_fun", uint64_t{trace::kErrorLevel})))

LTTNG_UST_TRACEPOINT_EVENT(osutils, record,
  LTTNG_UST_TP_ARGS(uint64_t, type, uint64_t, id, const void*, object),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_enum(osutils, type, uint64_t, type, type)
    lttng_ust_field_enum(osutils, function, uint64_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))))

LTTNG_UST_TRACEPOINT_EVENT(osutils, return,
  LTTNG_UST_TP_ARGS(uint64_t, type, uint64_t, id, const void*, object, int64_t, code),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_enum(osutils, type, uint64_t, type, type)
    lttng_ust_field_enum(osutils, function, uint64_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))
    lttng_ust_field_integer(int64_t, code, code)))

LTTNG_UST_TRACEPOINT_EVENT(osutils, message,
  LTTNG_UST_TP_ARGS(uint64_t, type, uint64_t, id, const void*, object, uint32_t, length, const char*, text),
  LTTNG_UST_TP_FIELDS(
    lttng_ust_field_enum(osutils, type, uint64_t, type, type)
    lttng_ust_field_enum(osutils, function, uint64_t, function, id)
    lttng_ust_field_integer_hex(uintptr_t, object, reinterpret_cast<uintptr_t>(object))
    lttng_ust_field_integer(uint32_t, length, length)
    lttng_ust_field_sequence_text(char, text, text, uint32_t, length)))
// clang-format on

#endif

#include <lttng/tracepoint-event.h>
