// The numbers in trace records, which the trace frame writes and libtrc names in its files. ldtr.h is installed without
// this header, so it repeats those that traced programs need; ldtr.cpp compares them.
#pragma once

#include <stdint.h>

namespace trace {

// Bits of trcEvents.
constexpr uint64_t kEvents33 = 0x1000;
constexpr uint64_t kErrorEvents33 = 0x2000;
constexpr uint64_t kEvents43 = 0x10000;
constexpr uint64_t kErrorEvents43 = 0x20000;
constexpr uint64_t kDebugEvents = 0x4000000;

// Record types.
constexpr uint64_t kEntry33 = 0x3200000;
constexpr uint64_t kExit33 = 0x3210000;
constexpr uint64_t kErrorExit33 = 0x30B0000;
constexpr uint64_t kEntry43 = 0x32A0000;
constexpr uint64_t kExit43 = 0x32B0000;
constexpr uint64_t kErrorExit43 = 0x30C0000;
constexpr uint64_t kDebug = 0x3400000;
constexpr uint64_t kDebugError = 0x3070000;
constexpr bool isExit(uint64_t type) {
  return type == kExit33 || type == kExit43 || type == kErrorExit33 || type == kErrorExit43;
}

// The rest of a longer text is left out: the time that readers take grows with the square of the length.
constexpr uint64_t kMaxTextBytes = 64 << 10;

// Levels of debug messages. Messages of ldtr_fun, the scope of code without a function id, have their level as id.
constexpr unsigned int kOrdinaryLevel = 0xC8010000;
constexpr unsigned int kErrorLevel = 0xC8110000;

// The id of a traced function. The top byte is libosutils' component number. The low byte is 0, and a debug message has
// the low byte of its level there.
constexpr uint64_t kLevelByte = 0xFF;
constexpr uint64_t functionId(unsigned int module, unsigned int ordinal) {
  return 0x3E000000U | module << 16 | ordinal << 8;
}

// What the code in a function's exit record says.
enum class Recorded {
  kCode,     // a failure unless it is 0
  kSuccess,  // 1 for success, 0 for a failure
  kAnswer,   // 1 for yes, 0 for no: neither is a failure
  kNumber,   // a failure if it is negative
  kNothing   // always 0, whatever the result
};

}  // namespace trace
