#include "clock.h"

#include <fcntl.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>

#include "descriptors.h"

namespace trc {

namespace {

constexpr uint64_t kValidNanoseconds = 100'000;
// The rate is measured over at least the first and at most about the second number of nanoseconds.
constexpr uint64_t kMinMeasurement = 1'000'000;
constexpr uint64_t kMaxMeasurement = 1'000'000'000;
// A reading that takes longer was interrupted, so the clock and the counter are not of the same moment.
constexpr uint64_t kMaxReadingCycles = 1000;
// 0.1 to 10 nanoseconds per cycle, times 2^32. Other rates are measurement errors.
constexpr uint64_t kMinRate = (uint64_t{1} << 32) / 10;
constexpr uint64_t kMaxRate = (uint64_t{1} << 32) * 10;

std::atomic<bool> is_tsc_clock_source{false};

uint64_t readClock() {
  timespec time;
  (void)clock_gettime(CLOCK_MONOTONIC, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000U + static_cast<uint64_t>(time.tv_nsec);
}

// Within a thousandth of each other. The counter jumps when a machine is suspended or migrated.
bool isSameRate(uint64_t a, uint64_t b) { return std::max(a, b) - std::min(a, b) <= b / 1000; }

}  // namespace

uint64_t Clock::synchronize() {
  valid_cycles_ = 0;
  if (!is_tsc_clock_source.load(std::memory_order_relaxed)) return readClock();
  const uint64_t before = readCounter();
  const uint64_t time = readClock();
  const uint64_t cycles = readCounter();
  if (cycles - before > kMaxReadingCycles) return time;

  const uint64_t measured = time - origin_time_;
  if (measured >= kMinMeasurement) {
    uint64_t rate = 0;
    // Records may be hours apart. The shift would then overflow, so the measurement starts again. The first one is no
    // measurement: it is the time since the machine was started.
    if (origin_time_ != 0 && cycles > origin_cycles_ && measured < 4 * kMaxMeasurement) {
      rate = (measured << kRateBits) / (cycles - origin_cycles_);
    }
    if (rate < kMinRate || rate > kMaxRate) rate = 0;
    is_confirmed_ = rate_ != 0 && isSameRate(rate, rate_);
    rate_ = rate;
    if (!is_confirmed_ || measured >= kMaxMeasurement) {
      origin_cycles_ = cycles;
      origin_time_ = time;
    }
  }
  if (!is_confirmed_) return time;
  cycles_ = cycles;
  time_ = time;
  valid_cycles_ = (kValidNanoseconds << kRateBits) / rate_;
  return time;
}

void checkClockSource() {
#if defined(__x86_64__)
  const int file = openAboveStandardStreams(
      AT_FDCWD, "/sys/devices/system/clocksource/clocksource0/current_clocksource", O_RDONLY);
  if (file == -1) return;
  char name[8];
  const ssize_t length = read(file, name, sizeof name);
  (void)close(file);
  is_tsc_clock_source.store(length == 4 && memcmp(name, "tsc\n", 4) == 0,
                            std::memory_order_relaxed);
#endif
}

}  // namespace trc
