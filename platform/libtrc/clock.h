// The time of a thread's records: CLOCK_MONOTONIC at a fraction of its cost.
//
// Reading the clock is what a record costs most. Where the kernel itself keeps the time by the processor's
// cycle counter, records that follow each other closely take theirs from that counter: for at most 0.1 ms
// after the clock was read, at the rate that the two had in the last seconds. A thread's times never go
// back, and differ from the clock's by less than a microsecond.
#pragma once

#include <stdint.h>

#include <algorithm>
#if defined(__x86_64__)
#include <x86intrin.h>
#endif

namespace trc {

inline uint64_t readCounter() {
#if defined(__x86_64__)
  return __rdtsc();
#else
  return 0;
#endif
}

class Clock {
 public:
  // Nanoseconds of CLOCK_MONOTONIC.
  __attribute__((always_inline)) uint64_t now() {
    last_ = std::max(last_, valid_cycles_ != 0 ? extrapolate() : synchronize());
    return last_;
  }

 private:
  static constexpr unsigned kRateBits = 32;

  __attribute__((always_inline)) uint64_t extrapolate() {
    const uint64_t cycles = readCounter() - cycles_;
    return cycles < valid_cycles_ ? time_ + (cycles * rate_ >> kRateBits) : synchronize();
  }
  uint64_t synchronize();

  uint64_t last_;
  // One moment by both clocks, and for how many cycles after it the rate is applied; 0: not at all.
  uint64_t cycles_;
  uint64_t time_;
  uint64_t valid_cycles_;
  uint64_t rate_;      // nanoseconds per cycle, times 2^32; 0: unknown
  bool is_confirmed_;  // by a second measurement
  // The start of the rate's measurement; 0: none.
  uint64_t origin_cycles_;
  uint64_t origin_time_;
};

// Finds out whether the kernel's clock source is the cycle counter. Before the first call now() does not use it.
void checkClockSource();

}  // namespace trc
