// The clock of the records. The processor's counter and the kernel's clock are both replaced, so that each reading of
// either is known: the kernel raises SIGSEGV at an instruction that reads the counter.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <ucontext.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "test_libtrc_files.h"
#include "world.h"

using testing::ElementsAre;

namespace {

std::atomic<int> counter_readings{0};

#if defined(__x86_64__)
void readCounterInstead(int, siginfo_t*, void* context) {
  greg_t* const registers = static_cast<ucontext_t*>(context)->uc_mcontext.gregs;
  const auto* const code = reinterpret_cast<const unsigned char*>(registers[REG_RIP]);
  if (code[0] == 0x0F && code[1] == 0x31) {  // RDTSC
    registers[REG_RIP] += 2;
  } else if (code[0] == 0x0F && code[1] == 0x01 && code[2] == 0xF9) {  // RDTSCP
    registers[REG_RIP] += 3;
    registers[REG_RCX] = 0;
  } else {
    (void)signal(SIGSEGV, SIG_DFL);
    return;
  }
  // A sanitizer's runtime may read it too.
  const auto distance = registers[REG_RIP] - reinterpret_cast<greg_t>(&trcWriteRec);
  if (distance > -(1 << 20) && distance < (1 << 20)) ++counter_readings;
  registers[REG_RAX] = static_cast<greg_t>(fake::counter & 0xFFFFFFFF);
  registers[REG_RDX] = static_cast<greg_t>(fake::counter >> 32);
}

bool replaceCounter() {
  struct sigaction action = {};
  action.sa_sigaction = readCounterInstead;
  action.sa_flags = SA_SIGINFO;
  return sigaction(SIGSEGV, &action, nullptr) == 0 && prctl(PR_SET_TSC, PR_TSC_SIGSEGV) == 0;
}
#else
bool replaceCounter() { return false; }
#endif

constexpr int kCannotReplace = 77;

// One thread's clock, from its first record on.
class TrcClock : public testing::Test {
 protected:
  // Runs the body in a process whose clock and counter are the test's own. The kernel's clock source is as given.
  // Without one, it is what the kernel says.
  void withClocks(const char* source, const std::function<void()>& body,
                  const std::function<int(const std::function<int()>&)>& run = inChild) {
    const int result = run([&] {
      // The machine has run for two seconds only.
      fake::useClock(2'000'000'000);
      fake::counter = 6'000'000'000;
      fake::files.erase(fake::kClockSource);
      if (source != nullptr) fake::files[fake::kClockSource] = temp.file("source", source);
      if (traceInto(temp.path("t")) != 0) return 1;
      if (!replaceCounter()) return kCannotReplace;
      record(kEntry, kDoesFileExist);
      forgetReadings();
      body();
      return 0;
    });
    fs::remove_all(temp.path("t"));
    if (result == kCannotReplace) GTEST_SKIP() << "the processor's counter cannot be replaced here";
    EXPECT_EQ(result, 0);
  }

  // Writes a record after this time by both clocks. Returns how often it read the clock.
  int recordAfter(uint64_t nanoseconds, uint64_t cycles) {
    fake::monotonic += nanoseconds;
    fake::counter += cycles;
    record(kEntry, kDoesFileExist);
    const int before = readings_;
    forgetReadings();
    return readings_ - before;
  }
  void forgetReadings() { readings_ = fake::clock_readings; }

  bool isInterpolated() { return recordAfter(0, 0) == 0; }

  // Lets these times pass again and again, from the first record that may use the counter on. Returns how often, until
  // the clock was interpolated; 0: it never was.
  int stepsUntilInterpolated(uint64_t nanoseconds, uint64_t cycles) {
    EXPECT_EQ(recordAfter(0, 0), 1);
    for (int step = 1; step <= 8; ++step) {
      EXPECT_EQ(recordAfter(nanoseconds, cycles), 1);
      if (isInterpolated()) return step;
    }
    return 0;
  }

  // At three cycles per nanosecond.
  void beginToInterpolate() { EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000), 2); }

  // The time of the last record.
  uint64_t lastTime() {
    const auto trace = files::readTrace(files::onlyTrace(temp.path("t")));
    const auto pid = static_cast<uint64_t>(getpid());
    return files::recordsOf(trace, pid, 0).back().time;
  }

  const TempDir temp;

 private:
  int readings_ = 0;
};

TEST_F(TrcClock, IsReadForEachRecordUnlessItsSourceIsTheCounter) {
  for (const char* const source :
       {"hpet\n", "", "tsc", "tsc\n\n", "tsc-early\n", "tscx", "xtsc", "TSC\n", "kvm-clock\n"}) {
    SCOPED_TRACE(source);
    withClocks(source, [&] {
      EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000), 0);
      EXPECT_EQ(counter_readings, 0);
    });
  }
}

TEST_F(TrcClock, IsReadForEachRecordWhereItsSourceIsUnknown) {
  withClocks("", [&] {
    fake::files[fake::kClockSource] = temp.path("missing");
    EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000), 0);
  });
}

TEST_F(TrcClock, HasItsSourceReadFromTheKernel) {
  REQUIRE_ROOT("to mount another file over the kernel's");
  if (!pathExists(fake::kClockSource)) GTEST_SKIP() << "no " << fake::kClockSource << " here";
  for (const bool is_counter : {true, false}) {
    SCOPED_TRACE(is_counter);
    const std::string source = temp.file("mounted", is_counter ? "tsc\n" : "acpi_pm\n");
    withClocks(
        nullptr,
        [&] { EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000), is_counter ? 2 : 0); },
        [&](const std::function<int()>& body) {
          return withPrivateMounts([&] {
            const int mounted =
                mount(source.c_str(), fake::kClockSource, nullptr, MS_BIND, nullptr);
            return mounted == 0 ? body() : 2;
          });
        });
  }
}

TEST_F(TrcClock, IsInterpolatedOnceTwoMeasurementsAgree) {
  withClocks("tsc\n", [&] { EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000), 2); });
}

TEST_F(TrcClock, MeasuresTheCounterOverAMillisecondOrMore) {
  withClocks("tsc\n", [&] { EXPECT_EQ(stepsUntilInterpolated(999'999, 3'000'000), 4); });
}

TEST_F(TrcClock, MeasuresTheCounterOverLessThanFourSeconds) {
  withClocks("tsc\n", [&] { EXPECT_EQ(stepsUntilInterpolated(3'999'999'999, 12'000'000'000), 2); });
  withClocks("tsc\n", [&] { EXPECT_EQ(stepsUntilInterpolated(4'000'000'000, 12'000'000'000), 0); });
}

TEST_F(TrcClock, AcceptsRatesOfATenthToTenNanosecondsPerCycle) {
  struct Case {
    uint64_t nanoseconds;
    uint64_t cycles;
    int steps;
  };
  for (const Case& one : {Case{1'000'000'000, 10'000'000'000, 2},
                          {1'000'000'000, 10'000'000'020, 0},
                          {1'000'000'000, 100'000'000, 2},
                          {1'000'000'001, 100'000'000, 0},
                          {1'000'000'000, 0, 0},
                          // the counter goes back
                          {1'000'000'000, uint64_t{0} - 1'000'000, 0}}) {
    SCOPED_TRACE(one.cycles);
    withClocks("tsc\n",
               [&] { EXPECT_EQ(stepsUntilInterpolated(one.nanoseconds, one.cycles), one.steps); });
  }
}

TEST_F(TrcClock, IsInterpolatedOnlyIfTheRatesAreWithinAThousandth) {
  struct Case {
    uint64_t nanoseconds;
    bool agrees;
  };
  // For 2^32 cycles the rate is the number of nanoseconds.
  constexpr uint64_t kCycles = uint64_t{1} << 32;
  for (const Case& one : {Case{3'003'000'000, true},
                          {3'003'000'001, false},
                          {2'997'000'000, true},
                          {2'996'999'999, false}}) {
    SCOPED_TRACE(one.nanoseconds);
    withClocks("tsc\n", [&] {
      EXPECT_EQ(recordAfter(0, 0), 1);
      EXPECT_EQ(recordAfter(3'000'000'000, kCycles), 1);
      EXPECT_FALSE(isInterpolated());
      EXPECT_EQ(recordAfter(one.nanoseconds, kCycles), 1);
      EXPECT_EQ(isInterpolated(), one.agrees);
    });
  }
}

// The thread was interrupted between the readings of the clock and of the counter.
TEST_F(TrcClock, IgnoresAReadingThatTookMoreThanAThousandCycles) {
  withClocks("tsc\n", [&] {
    fake::clock_step = 1000;
    EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000 - 2000), 2);
  });
  withClocks("tsc\n", [&] {
    fake::clock_step = 1001;
    EXPECT_EQ(stepsUntilInterpolated(1'000'000, 3'000'000 - 2002), 0);
  });
}

TEST_F(TrcClock, IsInterpolatedForAtMostATenthOfAMillisecond) {
  withClocks("tsc\n", [&] {
    beginToInterpolate();
    const uint64_t began = fake::monotonic;
    EXPECT_EQ(recordAfter(1, 3), 0);
    EXPECT_EQ(lastTime(),
              began);  // three cycles are a little less than a nanosecond by the measured rate
    EXPECT_EQ(recordAfter(49'999, 149'998), 0);
    EXPECT_EQ(lastTime(), began + 50'000);
    EXPECT_EQ(recordAfter(49'999, 149'998), 0);
    EXPECT_EQ(lastTime(), began + 99'999);
    // 300,000 cycles since the clock was read. The rate is still valid, so it is read once.
    EXPECT_EQ(recordAfter(1, 1), 1);
    EXPECT_EQ(lastTime(), fake::monotonic);
    EXPECT_TRUE(isInterpolated());
    EXPECT_EQ(lastTime(), fake::monotonic);
    EXPECT_EQ(recordAfter(500'000, 1'500'000), 1);
    EXPECT_TRUE(isInterpolated());
  });
}

// A measurement of a second has ended, and the next one has not.
TEST_F(TrcClock, IsInterpolatedAlsoAtTheBeginningOfAMeasurement) {
  withClocks("tsc\n", [&] {
    EXPECT_EQ(stepsUntilInterpolated(1'000'000'000, 3'000'000'000), 2);
    EXPECT_EQ(recordAfter(200'000, 600'000), 1);
    EXPECT_TRUE(isInterpolated());
    EXPECT_EQ(lastTime(), fake::monotonic);
  });
}

TEST_F(TrcClock, IsReadAgainWhenTheRateHasChanged) {
  withClocks("tsc\n", [&] {
    EXPECT_EQ(stepsUntilInterpolated(1'000'000'000, 3'000'000'000), 2);
    EXPECT_EQ(recordAfter(1'000'000, 3'100'000), 1);
    EXPECT_FALSE(isInterpolated());
    EXPECT_EQ(recordAfter(1'000'000, 3'100'000), 1);
    EXPECT_TRUE(isInterpolated());
  });
}

// The longer the measurement, the more exact is the rate; but a rate that changes slowly must be followed.
TEST_F(TrcClock, MeasuresTheRateFromTheSameMomentForASecond) {
  struct Case {
    uint64_t first;     // nanoseconds
    uint64_t expected;  // nanoseconds of 200,000 cycles afterwards
  };
  // Three cycles per nanosecond at first, and then 3.0015, seen over the second measurement alone or over both.
  for (const Case& one : {Case{999'999'999, 66'650}, {1'000'000'000, 66'633}}) {
    SCOPED_TRACE(one.first);
    withClocks("tsc\n", [&] {
      EXPECT_EQ(recordAfter(0, 0), 1);
      EXPECT_EQ(recordAfter(2'000'000, 6'000'000), 1);
      EXPECT_EQ(recordAfter(one.first, 3 * one.first), 1);
      EXPECT_TRUE(isInterpolated());
      EXPECT_EQ(recordAfter(1'000'000'000, 3'001'500'000), 1);
      const uint64_t began = fake::monotonic;
      EXPECT_EQ(recordAfter(0, 200'000), 0);
      EXPECT_EQ(lastTime(), began + one.expected);
    });
  }
}

TEST_F(TrcClock, NeverGoesBack) {
  withClocks("tsc\n", [&] {
    beginToInterpolate();
    const uint64_t began = fake::monotonic;
    // The counter runs faster than before, by a third.
    EXPECT_EQ(recordAfter(45'000, 180'000), 0);
    EXPECT_EQ(lastTime(), began + 59'999);
    EXPECT_EQ(recordAfter(10'000, 150'000), 1);  // the clock says 55,000
    EXPECT_EQ(lastTime(), began + 59'999);
    EXPECT_EQ(recordAfter(10'000, 400'000), 1);
    EXPECT_EQ(lastTime(), began + 65'000);
  });
}

// When a machine is suspended or moved to another one, its counter may begin again.
TEST_F(TrcClock, IsReadWhenTheCounterHasGoneBack) {
  withClocks("tsc\n", [&] {
    beginToInterpolate();
    EXPECT_EQ(recordAfter(1000, uint64_t{0} - 4'000'000), 1);
    EXPECT_EQ(lastTime(), fake::monotonic);
  });
}

// An ignored reading ends the interpolation, and the counter then goes back to where it was valid.
TEST_F(TrcClock, IsReadAfterAReadingThatWasIgnored) {
  withClocks("tsc\n", [&] {
    beginToInterpolate();
    fake::clock_step = 5000;
    EXPECT_EQ(recordAfter(200'000, 600'000), 1);
    fake::clock_step = 0;
    EXPECT_EQ(recordAfter(200'000, uint64_t{0} - 604'000), 1);
    EXPECT_EQ(lastTime(), fake::monotonic);
  });
}

TEST_F(TrcClock, HasItsSourceCheckedForEachFile) {
  withClocks("tsc\n", [&] {
    beginToInterpolate();
    writeFile(temp.path("source"), "hpet\n");
    message(std::string(5000, 't'));  // in the next file
    EXPECT_EQ(recordAfter(200'000, 600'000), 1);
    EXPECT_FALSE(isInterpolated());
    writeFile(temp.path("source"), "tsc\n");
    traceMuch(1);
    fs::remove(temp.path("source"));  // what was known before remains
    traceMuch(2);
    forgetReadings();
    EXPECT_EQ(recordAfter(200'000, 600'000), 1);
    EXPECT_TRUE(isInterpolated());
  });
}

}  // namespace
