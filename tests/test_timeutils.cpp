// Time stamps in every kind of zone, and elapsed time.

#include <errno.h>
#include <gmock/gmock.h>
#include <limits.h>
#include <malloc.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr long kMay = 1146479445;      // 2006-05-01 10:30:45 UTC
constexpr long kJanuary = 1137330309;  // 2006-01-15 13:05:09 UTC
constexpr long kNewYear = 1136073600;  // 2006-01-01 00:00:00 UTC

constexpr char kBerlin[] = "CET-1CEST,M3.5.0,M10.5.0/3";
constexpr char kNewYork[] = "EST5EDT,M3.2.0,M11.1.0";
constexpr char kSydney[] = "AEST-10AEDT,M10.1.0,M4.1.0/3";

// Copies the stamp and frees it.
std::string stamp(int flag) {
  char* const text = getCurrentTimeStamp(flag);
  if (text == nullptr) return "(none)";
  std::string copy = text;
  free(text);
  return copy;
}

std::string stampAt(long seconds, long microseconds, int flag) {
  const FakeClock clock(seconds, microseconds);
  return stamp(flag);
}

// Runs the body in a child process with that zone: the C library keeps the zone in static storage.
void inZone(const char* zone, const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              EXPECT_EQ(setenv("TZ", zone, 1), 0);
              tzset();
              body();
              return 0;
            }),
            0)
      << zone;
}

// ---- getCurrentTimeStamp: layouts ----

TEST(TimeStamp, HasDateTimeMillisecondsAndZone) {
  inZone(kBerlin, [] { EXPECT_EQ(stampAt(kMay, 123456, 1), "2006-05-01-12:30:45.123+01:00DST"); });
  inZone(kNewYork, [] { EXPECT_EQ(stampAt(kJanuary, 7000, 1), "2006-01-15-08:05:09.007-05:00"); });
}

TEST(TimeStamp, WhenCompactHasDateAndTimeOnly) {
  inZone(kBerlin, [] { EXPECT_EQ(stampAt(kMay, 123456, 0), "2006y05y01y12y30y45"); });
  inZone(kNewYork, [] { EXPECT_EQ(stampAt(kJanuary, 7000, 0), "2006y01y15y08y05y09"); });
}

TEST(TimeStamp, CutsTheMicrosecondsOffAndPadsTheMilliseconds) {
  inZone("UTC0", [] {
    EXPECT_EQ(stampAt(kMay, 0, 1), "2006-05-01-10:30:45.000+00:00");
    EXPECT_EQ(stampAt(kMay, 999, 1), "2006-05-01-10:30:45.000+00:00");
    EXPECT_EQ(stampAt(kMay, 1000, 1), "2006-05-01-10:30:45.001+00:00");
    EXPECT_EQ(stampAt(kMay, 7999, 1), "2006-05-01-10:30:45.007+00:00");
    EXPECT_EQ(stampAt(kMay, 99'999, 1), "2006-05-01-10:30:45.099+00:00");
    EXPECT_EQ(stampAt(kMay, 999'000, 1), "2006-05-01-10:30:45.999+00:00");
    EXPECT_EQ(stampAt(kMay, 999'999, 1), "2006-05-01-10:30:45.999+00:00");
    EXPECT_EQ(stampAt(kMay, 999'999, 0), "2006y05y01y10y30y45");
  });
}

TEST(TimeStamp, IsChosenByTheLowByteOfTheFlag) {
  inZone("UTC0", [] {
    for (const int flag : {0, 256, 0x7f00, 0x10000, INT_MIN}) {
      EXPECT_EQ(stampAt(kMay, 123456, flag), "2006y05y01y10y30y45") << flag;
    }
    for (const int flag : {1, 2, 128, 255, -1, 0x101, 0x1ff, INT_MAX}) {
      EXPECT_EQ(stampAt(kMay, 123456, flag), "2006-05-01-10:30:45.123+00:00") << flag;
    }
  });
}

TEST(TimeStamp, KnowsTheCalendar) {
  inZone("UTC0", [] {
    EXPECT_EQ(stampAt(0, 0, 1), "1970-01-01-00:00:00.000+00:00");
    EXPECT_EQ(stampAt(-1, 999'999, 1), "1969-12-31-23:59:59.999+00:00");
    EXPECT_EQ(stampAt(kNewYear - 1, 0, 1), "2005-12-31-23:59:59.000+00:00");
    EXPECT_EQ(stampAt(1709164800, 0, 1), "2024-02-29-00:00:00.000+00:00");
    EXPECT_EQ(stampAt(2147483648, 0, 1), "2038-01-19-03:14:08.000+00:00");
    EXPECT_EQ(stampAt(2147483648, 0, 0), "2038y01y19y03y14y08");
  });
}

TEST(TimeStamp, HasRoomForAYearOfFiveDigits) {
  inZone("UTC0", [] {
    EXPECT_EQ(stampAt(253402300800, 5000, 1), "10000-01-01-00:00:00.005+00:00");
    EXPECT_EQ(stampAt(253402300800, 5000, 0), "10000y01y01y00y00y00");
  });
}

TEST(TimeStamp, HasTheDayOfTheZone) {
  inZone("<+14>-14",
         [] { EXPECT_EQ(stampAt(kNewYear - 50'400, 0, 1), "2006-01-01-00:00:00.000+14:00"); });
  inZone("<-12>12",
         [] { EXPECT_EQ(stampAt(kNewYear + 43'199, 0, 1), "2005-12-31-23:59:59.000-12:00"); });
}

TEST(TimeStamp, TakesTheTimeOfTheSystemClock) {
  inZone("UTC0", [] {
    const auto clock_stamp = [] {
      const time_t now = time(nullptr);
      tm utc = {};
      char text[32] = "";
      EXPECT_NE(strftime(text, sizeof text, "%Yy%my%dy%Hy%My%S", gmtime_r(&now, &utc)), 0U);
      return std::string(text);
    };
    const std::string before = clock_stamp();
    const std::string compact = stamp(0);
    const std::string full = stamp(1);
    EXPECT_EQ(compact.size(), 19U);
    EXPECT_EQ(full.size(), 29U);
    // time() may lag behind gettimeofday() by a tick, so only an earlier stamp is wrong.
    EXPECT_LE(before, compact);
    EXPECT_THAT(
        full, testing::MatchesRegex("[0-9]+-[0-9]+-[0-9]+-[0-9]+:[0-9]+:[0-9]+[.][0-9]+[+]00:00"));
  });
}

// ---- getCurrentTimeStamp: zones ----

struct ZoneCase {
  const char* zone;
  long seconds;
  const char* stamp;
};

void expectStamps(const std::vector<ZoneCase>& cases) {
  for (const ZoneCase& each : cases) {
    inZone(each.zone, [&] { EXPECT_EQ(stampAt(each.seconds, 5000, 255), each.stamp); });
  }
}

TEST(TimeStampZone, OfWholeHours) {
  expectStamps({
      {"UTC0", kMay, "2006-05-01-10:30:45.005+00:00"},
      {"CET-1", kMay, "2006-05-01-11:30:45.005+01:00"},
      {"JST-9", kMay, "2006-05-01-19:30:45.005+09:00"},
      {"<+14>-14", kMay, "2006-05-02-00:30:45.005+14:00"},
      {"<-01>1", kMay, "2006-05-01-09:30:45.005-01:00"},
      {"<-12>12", kMay, "2006-04-30-22:30:45.005-12:00"},
  });
}

TEST(TimeStampZone, OfHalfAndQuarterHoursLosesItsMinutes) {
  expectStamps({
      {"IST-5:30", kMay, "2006-05-01-16:00:45.005+05:00"},
      {"<+0545>-5:45", kMay, "2006-05-01-16:15:45.005+05:00"},
      {"<+0845>-8:45", kMay, "2006-05-01-19:15:45.005+08:00"},
      {"<+0930>-9:30", kMay, "2006-05-01-20:00:45.005+09:00"},
      {"<-0930>9:30", kMay, "2006-05-01-01:00:45.005-09:00"},
      {"NST3:30NDT,M3.2.0,M11.1.0", kMay, "2006-05-01-08:00:45.005-03:00DST"},
      {"NST3:30NDT,M3.2.0,M11.1.0", kJanuary, "2006-01-15-09:35:09.005-03:00"},
      {"<+1245>-12:45<+1345>,M9.5.0/2:45,M4.1.0/3:45", kMay, "2006-05-01-23:15:45.005+12:00"},
      {"<+1245>-12:45<+1345>,M9.5.0/2:45,M4.1.0/3:45", kJanuary,
       "2006-01-16-02:50:09.005+12:00DST"},
  });
}

TEST(TimeStampZone, OfLessThanAnHourKeepsItsSign) {
  expectStamps({
      {"<+0030>-0:30", kMay, "2006-05-01-11:00:45.005+00:00"},
      {"<-0030>0:30", kMay, "2006-05-01-10:00:45.005-00:00"},
      {"<-0001>0:00:01", kMay, "2006-05-01-10:30:44.005-00:01"},
  });
}

TEST(TimeStampZone, OfSecondsHasThemInPlaceOfTheMinutes) {
  expectStamps({
      {"LMT-0:53:28", kMay, "2006-05-01-11:24:13.005+00:28"},
      {"LMT0:44:30", kMay, "2006-05-01-09:46:15.005-00:30"},
      {"LMT-5:53:20", kMay, "2006-05-01-16:24:05.005+05:20"},
      {"LMT4:56:02", kMay, "2006-05-01-05:34:43.005-04:02"},
      {"XYZ-24:59:59", kMay, "2006-05-02-11:30:44.005+24:59"},
      {"XYZ24:59:59", kMay, "2006-04-30-09:30:46.005-24:59"},
  });
}

TEST(TimeStampZone, WithDaylightSavingKeepsItsStandardOffset) {
  expectStamps({
      {kBerlin, kMay, "2006-05-01-12:30:45.005+01:00DST"},
      {kBerlin, kJanuary, "2006-01-15-14:05:09.005+01:00"},
      {kNewYork, kMay, "2006-05-01-06:30:45.005-05:00DST"},
      {kNewYork, kJanuary, "2006-01-15-08:05:09.005-05:00"},
      // south of the equator summer is in January
      {kSydney, kMay, "2006-05-01-20:30:45.005+10:00"},
      {kSydney, kJanuary, "2006-01-16-00:05:09.005+10:00DST"},
      {"<-04>4<-03>,M9.1.6/24,M4.1.6/24", kMay, "2006-05-01-06:30:45.005-04:00"},
      {"<-04>4<-03>,M9.1.6/24,M4.1.6/24", kJanuary, "2006-01-15-10:05:09.005-04:00DST"},
      // by half an hour, by two hours
      {"<+1030>-10:30<+11>-11,M10.1.0,M4.1.0", kMay, "2006-05-01-21:00:45.005+10:00"},
      {"<+1030>-10:30<+11>-11,M10.1.0,M4.1.0", kJanuary, "2006-01-16-00:05:09.005+10:00DST"},
      {"<+00>0<+02>-2,M3.5.0/1,M10.5.0/3", kMay, "2006-05-01-12:30:45.005+00:00DST"},
      {"<+00>0<+02>-2,M3.5.0/1,M10.5.0/3", kJanuary, "2006-01-15-13:05:09.005+00:00"},
      // from west of the meridian to it
      {"<-01>1<+00>,M3.5.0/0,M10.5.0/1", kMay, "2006-05-01-10:30:45.005-01:00DST"},
      {"<-01>1<+00>,M3.5.0/0,M10.5.0/1", kJanuary, "2006-01-15-12:05:09.005-01:00"},
      // negative daylight saving: in winter
      {"IST-1GMT0,M10.5.0,M3.5.0/1", kMay, "2006-05-01-11:30:45.005+01:00"},
      {"IST-1GMT0,M10.5.0,M3.5.0/1", kJanuary, "2006-01-15-13:05:09.005+01:00DST"},
  });
}

TEST(TimeStampZone, SaysDstFromTheFirstToTheLastSecondOfIt) {
  expectStamps({
      {kBerlin, 1143334799, "2006-03-26-01:59:59.005+01:00"},
      {kBerlin, 1143334800, "2006-03-26-03:00:00.005+01:00DST"},
      {kBerlin, 1162083599, "2006-10-29-02:59:59.005+01:00DST"},
      {kBerlin, 1162083600, "2006-10-29-02:00:00.005+01:00"},
      {kSydney, 1143907199, "2006-04-02-02:59:59.005+10:00DST"},
      {kSydney, 1143907200, "2006-04-02-02:00:00.005+10:00"},
      {kSydney, 1159631999, "2006-10-01-01:59:59.005+10:00"},
      {kSydney, 1159632000, "2006-10-01-03:00:00.005+10:00DST"},
  });
}

TEST(TimeStampZone, HasOneOffsetInEveryHourOfTheYear) {
  struct Case {
    const char* zone;
    const char* offset;
  };
  for (const Case& each : {Case{kBerlin, "+01:00"}, Case{kNewYork, "-05:00"},
                           Case{kSydney, "+10:00"}, Case{"NST3:30NDT,M3.2.0,M11.1.0", "-03:00"}}) {
    inZone(each.zone, [&] {
      int wrong = 0;
      for (long hour = 0; hour < 365 * 24; ++hour) {
        const std::string text = stampAt(kNewYear + hour * 3600 + 1800, 0, 1);
        if (text.substr(std::min<size_t>(text.size(), 23), 6) != each.offset && ++wrong <= 5) {
          ADD_FAILURE() << each.zone << ": " << text;
        }
      }
      EXPECT_EQ(wrong, 0);
    });
  }
}

TEST(TimeStampZone, MayBeNamed) {
  // Monrovia kept 44 min 30 s until 1972.
  for (const ZoneCase& each :
       std::vector<ZoneCase>{{"Europe/Berlin", kMay, "2006-05-01-12:30:45.005+01:00DST"},
                             {"America/New_York", kJanuary, "2006-01-15-08:05:09.005-05:00"},
                             {"America/St_Johns", kJanuary, "2006-01-15-09:35:09.005-03:00"},
                             {"Asia/Kolkata", kMay, "2006-05-01-16:00:45.005+05:00"},
                             {"Asia/Kathmandu", kMay, "2006-05-01-16:15:45.005+05:00"},
                             {"Australia/Sydney", kJanuary, "2006-01-16-00:05:09.005+10:00DST"},
                             {"Australia/Lord_Howe", kJanuary, "2006-01-16-00:05:09.005+10:00DST"},
                             {"Pacific/Chatham", kJanuary, "2006-01-16-02:50:09.005+12:00DST"},
                             {"Pacific/Marquesas", kMay, "2006-05-01-01:00:45.005-09:00"},
                             {"Africa/Monrovia", 0, "1969-12-31-23:15:30.005-00:30"}}) {
    const std::string file = std::string("/usr/share/zoneinfo/") + each.zone;
    if (!pathExists(file)) GTEST_SKIP() << file << " is not installed";
    expectStamps({each});
  }
}

// ---- getCurrentTimeStamp: buffer, failures, records ----

TEST(TimeStamp, IsInABufferOf1024BytesThatIsZeroAfterIt) {
  constexpr size_t kBytes = 1024;
  for (const int flag : {0, 1}) {
    // Used blocks of that size, more than malloc's cache holds: malloc returns them without zeroing
    // them.
    std::vector<std::unique_ptr<char, decltype(&free)>> used;
    for (int i = 0; i < 16; ++i) {
      used.emplace_back(static_cast<char*>(malloc(kBytes)), free);
      memset(used.back().get(), 0xa5, kBytes);
    }
    used.clear();

    char* const text = getCurrentTimeStamp(flag);
    ASSERT_NE(text, nullptr);

    const size_t usable = malloc_usable_size(text);
    EXPECT_GE(usable, kBytes);
    EXPECT_LT(usable, kBytes + 64);
    EXPECT_TRUE(
        std::all_of(text + strlen(text), text + kBytes, [](char byte) { return byte == '\0'; }));
    free(text);
  }
}

TEST(TimeStamp, LeavesItsEntryAndExit) {
  const Records records;
  stamp(0);
  stamp(1);
  EXPECT_THAT(records.trail(), ElementsAre("> getCurrentTimeStamp", "< getCurrentTimeStamp 0",
                                           "> getCurrentTimeStamp", "< getCurrentTimeStamp 0"));
}

TEST(TimeStamp, OwnsNothingButTheResult) {
  REQUIRE_OWN_MALLOC();
  for (const int flag : {0, 1}) {
    const LiveAllocations live;
    char* const text = getCurrentTimeStamp(flag);
    EXPECT_EQ(live.blocks(), 1);
    free(text);
    EXPECT_EQ(live.blocks(), 0);
  }
}

TEST(TimeStamp, IsNullWhenAnAllocationFails) {
  REQUIRE_OWN_MALLOC();
  constexpr const char* kTexts[] = {"timeutils:getCurrentTimeStamp ran out of memory 0.\n",
                                    "timeutils:getCurrentTimeStamp ran out of memory 2.\n",
                                    "timeutils:getCurrentTimeStamp ran out of memory 2.\n"};
  for (const int flag : {0, 1}) {
    for (int nth = 1;; ++nth) {
      SCOPED_TRACE(nth);
      const Records records;
      const LiveAllocations live;
      FailingCall allocation(Call::allocation, ENOMEM, nth);
      const FailingCall clock(Call::gettimeofday, 0, kNever);
      char* const text = getCurrentTimeStamp(flag);
      allocation.disarm();  // assertions allocate too
      if (!allocation.fired()) {
        EXPECT_NE(text, nullptr);
        EXPECT_EQ(nth, 4);
        free(text);
        break;
      }
      EXPECT_EQ(text, nullptr);
      EXPECT_EQ(live.blocks(), 0);
      EXPECT_EQ(clock.calls(), nth == 1 ? 0 : 1);
      ASSERT_LE(nth, 3);
      EXPECT_THAT(records.trail(),
                  ElementsAre("> getCurrentTimeStamp", std::string("D ") + kTexts[nth - 1],
                              "< getCurrentTimeStamp 0"));
    }
  }
}

TEST(TimeStamp, IsNullWhenItsSecondPartCannotBePrinted) {
  const Records records;
  const LiveAllocations live;
  const FailingCall print(Call::vra_snprintf, EIO);

  EXPECT_EQ(getCurrentTimeStamp(1), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(records.trail(), ElementsAre("> getCurrentTimeStamp",
                                           "D timeutils:getCurrentTimeStamp vra_snprintf failed.\n",
                                           "< getCurrentTimeStamp 0"));
}

TEST(TimeStamp, TakesAPrintThatAnswersAnotherNegativeNumber) {
  inZone("UTC0", [] {
    const Records records;
    const OddPrint print(-2);
    EXPECT_EQ(stampAt(kMay, 123456, 1), "2006-05-01-10:30:45.123+00:00");
    EXPECT_THAT(records.texts(), IsEmpty());
  });
}

// 8 minus the length of the first part, in unsigned 32-bit arithmetic.
TEST(TimeStamp, BoundsItsSecondPartByNearly4GiB) {
  inZone("UTC0", [] {
    EXPECT_EQ(stampAt(kMay, 0, 1).size(), 29U);
    EXPECT_EQ(passed.print_size, 4'294'967'284U);
    EXPECT_EQ(stampAt(253402300800, 0, 1).size(), 30U);
    EXPECT_EQ(passed.print_size, 4'294'967'283U);
  });
}

TEST(TimeStamp, WhenCompactHasNoSecondPart) {
  const FailingCall print(Call::vra_snprintf, EIO);
  EXPECT_EQ(stampAt(kMay, 0, 0).size(), 19U);
  EXPECT_EQ(print.calls(), 0);
}

TEST(TimeStamp, SaysNothingOfAFailureWithoutDebugTracing) {
  const Records records(kAllEvents & ~kDebug);
  const std::vector<std::string> silent = {"> getCurrentTimeStamp", "< getCurrentTimeStamp 0"};
  {
    const FailingCall print(Call::vra_snprintf, EIO);
    EXPECT_EQ(stamp(1), "(none)");
  }
  EXPECT_EQ(records.trail(), silent);
  EXPECT_THAT(records.prints(), IsEmpty());

  if (sanitizerOwnsMalloc()) return;
  for (int nth = 1; nth <= 3; ++nth) {
    const FailingCall allocation(Call::calloc, ENOMEM, nth);
    char* const text = getCurrentTimeStamp(1);
    EXPECT_TRUE(allocation.fired());
    EXPECT_EQ(text, nullptr);
  }
  EXPECT_EQ(records.trail().size(), 8U);
  EXPECT_THAT(records.texts(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(TimeStamp, OfAClockThatCannotBeReadIsNull) {
  inZone("UTC0", [] {
    const LiveAllocations live;
    for (const int flag : {0, 1}) {
      SCOPED_TRACE(flag);
      const FailingCall clock(Call::gettimeofday, EFAULT);
      EXPECT_EQ(getCurrentTimeStamp(flag), nullptr);
      EXPECT_TRUE(clock.fired());
    }
    EXPECT_EQ(live.blocks(), 0);
  });
}

TEST(TimeStamp, OfATimeWithoutAnOwnYearIsNull) {
  inZone("UTC0", [] {
    const LiveAllocations live;
    for (const int flag : {0, 1}) {
      SCOPED_TRACE(flag);
      const FakeClock clock(LONG_MAX, 0);
      EXPECT_EQ(getCurrentTimeStamp(flag), nullptr);
    }
    EXPECT_EQ(live.blocks(), 0);
  });
}

TEST(TimeStamp, OfATimeThatCannotBeConvertedIsNull) {
  inZone("UTC0", [] {
    const LiveAllocations live;
    for (int nth = 1; nth <= 3; ++nth) {
      SCOPED_TRACE(nth);
      const FailingCall conversion(Call::localtime_r, EOVERFLOW, nth);
      EXPECT_EQ(getCurrentTimeStamp(1), nullptr);
      EXPECT_TRUE(conversion.fired());
    }
    EXPECT_EQ(live.blocks(), 0);
  });
}

TEST(TimeStamp, MayBeTakenByManyThreadsAtOnce) {
  inZone(kBerlin, [] {
    constexpr int kThreads = 4;
    std::atomic<int> wrong = 0;
    std::vector<std::thread> threads;
    for (int number = 0; number < kThreads; ++number) {
      threads.emplace_back([number, &wrong] {
        const FakeClock clock(kMay + number, number * 1000);
        const std::string digit = std::to_string(number);
        const std::string expected =
            "2006-05-01-12:30:4" + std::to_string(5 + number) + ".00" + digit + "+01:00DST";
        for (int round = 0; round < 500; ++round) {
          if (stamp(1) != expected) ++wrong;
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(wrong, 0);
  });
}

// ---- current_time_in_milliseconds ----

long elapsedAt(long seconds, long microseconds) {
  const FakeClock clock(seconds, microseconds);
  return current_time_in_milliseconds();
}

// Runs the body in a process that has not called current_time_in_milliseconds yet.
void inFreshProcess(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

TEST(ElapsedTime, CountsFromTheFirstCallOfTheProcess) {
  inFreshProcess([] {
    EXPECT_EQ(elapsedAt(1000, 500'000), 0);
    EXPECT_EQ(elapsedAt(1000, 500'000), 0);
    EXPECT_EQ(elapsedAt(1000, 501'000), 1);
    EXPECT_EQ(elapsedAt(1001, 500'000), 1000);
    EXPECT_EQ(elapsedAt(1002, 250'000), 1750);
    EXPECT_EQ(elapsedAt(1001, 500'000), 1000);  // the zero point stays
  });
}

TEST(ElapsedTime, IsCutOffTowardsZero) {
  inFreshProcess([] {
    EXPECT_EQ(elapsedAt(1000, 500'000), 0);
    EXPECT_EQ(elapsedAt(1000, 500'999), 0);
    EXPECT_EQ(elapsedAt(1000, 501'999), 1);
    EXPECT_EQ(elapsedAt(1001, 499'999), 999);
    EXPECT_EQ(elapsedAt(1000, 499'999), 0);
    EXPECT_EQ(elapsedAt(1000, 499'001), 0);
    EXPECT_EQ(elapsedAt(1000, 499'000), -1);
    EXPECT_EQ(elapsedAt(1000, 498'001), -1);
  });
}

TEST(ElapsedTime, IsNegativeAfterTheClockWasSetBack) {
  inFreshProcess([] {
    EXPECT_EQ(elapsedAt(1000, 0), 0);
    EXPECT_EQ(elapsedAt(999, 0), -1000);
    EXPECT_EQ(elapsedAt(0, 0), -1'000'000);
    EXPECT_EQ(elapsedAt(-1, 999'000), -1'000'001);
  });
}

TEST(ElapsedTime, IsA64BitNumber) {
  inFreshProcess([] {
    EXPECT_EQ(elapsedAt(0, 0), 0);
    EXPECT_EQ(elapsedAt(4'000'000'000, 1000), 4'000'000'000'001);
  });
}

TEST(ElapsedTime, OfTheFirstCallLiesBetweenItsTwoReadingsOfTheClock) {
  inFreshProcess([] {
    std::optional<FakeClock> clock(std::in_place, 1000, 0);
    const BeforeCall later(
        Call::gettimeofday,
        [&] {
          clock.reset();
          clock.emplace(1000, 3999);
        },
        2);
    const FailingCall readings(Call::gettimeofday, 0, kNever);

    EXPECT_EQ(current_time_in_milliseconds(), 3);
    EXPECT_EQ(readings.calls(), 2);
    EXPECT_EQ(current_time_in_milliseconds(), 3);
    EXPECT_EQ(readings.calls(), 3) << "one reading for each later call";
  });
}

TEST(ElapsedTime, OfAFirstCallDuringAnotherIsNotCountedFromTheBeginningOfTime) {
  inFreshProcess([] {
    long others = -1;
    const BeforeCall during(Call::gettimeofday,
                            [&] { std::thread([&] { others = elapsedAt(1000, 0); }).join(); });

    EXPECT_EQ(elapsedAt(1000, 5000), 0);

    ASSERT_TRUE(during.fired());
    EXPECT_EQ(others, 0);
    EXPECT_EQ(elapsedAt(1001, 5000), 1000) << "from the zero point of the last to set it";
  });
}

TEST(ElapsedTime, GrowsWithTheSystemClock) {
  inFreshProcess([] {
    timespec began = {};
    clock_gettime(CLOCK_REALTIME, &began);
    const long first = current_time_in_milliseconds();
    usleep(30'000);
    const long second = current_time_in_milliseconds();
    timespec ended = {};
    clock_gettime(CLOCK_REALTIME, &ended);
    const long most =
        (ended.tv_sec - began.tv_sec) * 1000 + (ended.tv_nsec - began.tv_nsec) / 1'000'000 + 1;

    EXPECT_GE(first, 0);
    EXPECT_GE(second, first + 29);
    EXPECT_LE(second, most);
  });
}

TEST(ElapsedTime, OfAClockThatCannotBeReadCountsFromTheBeginningOfTime) {
  inFreshProcess([] {
    const FailingCall clock(Call::gettimeofday, EFAULT, 1, 2);
    EXPECT_EQ(current_time_in_milliseconds(), 0);
    EXPECT_EQ(clock.calls(), 2);
    EXPECT_EQ(elapsedAt(5, 1000), 5001);
  });
}

TEST(ElapsedTime, LeavesNoTrace) {
  inFreshProcess([] {
    const Records records;
    current_time_in_milliseconds();
    current_time_in_milliseconds();
    EXPECT_THAT(records.all(), IsEmpty());
    EXPECT_THAT(records.prints(), IsEmpty());
  });
}

TEST(ElapsedTime, MayBeAskedByManyThreadsAtOnceAfterTheFirstCall) {
  inFreshProcess([] {
    EXPECT_EQ(elapsedAt(1000, 0), 0);
    std::atomic<int> wrong = 0;
    std::vector<std::thread> threads;
    for (int number = 0; number < 4; ++number) {
      threads.emplace_back([number, &wrong] {
        const FakeClock clock(1000 + number, 0);
        for (int round = 0; round < 1000; ++round) {
          if (current_time_in_milliseconds() != number * 1000) ++wrong;
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(wrong, 0);
  });
}

}  // namespace
