#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "ldtr.h"
#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "world.h"

using testing::ElementsAre;
using testing::HasSubstr;
using testing::SizeIs;

namespace {

TEST(TrcRecords, FourThreadsLoseNothingAndKeepTheirOrder) {
  constexpr int kThreads = 4;
  constexpr int kRecords = 10'000;
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([t] {
        for (int i = 0; i < kRecords; ++i) {
          message(std::to_string(t) + " " + std::to_string(i),
                  i % 2 == 0 ? 0x3E060100 : 0x3E040201);
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
  });

  const std::vector<Event> events = readEvents(temp.path("t"));

  ASSERT_THAT(events, SizeIs(kThreads * kRecords));
  std::map<unsigned long, int> next;
  std::map<unsigned long, std::string> names;
  for (const Event& event : events) {
    const int number = next[event.tid]++;
    const size_t blank = event.text.find(' ');
    const std::string thread = event.text.substr(0, blank);
    ASSERT_EQ(names.emplace(event.tid, thread).first->second, thread);
    ASSERT_EQ(event.text.substr(blank + 1), std::to_string(number));
    ASSERT_EQ(event.type, "\"debug\" : container = 0x3400000");
    ASSERT_EQ(event.function, number % 2 == 0 ? "\"doesFileExist\" : container = 0x3E060100"
                                              : "\"putEnvVar\" : container = 0x3E040201");
  }
  EXPECT_THAT(next, SizeIs(kThreads));
}

uint64_t monotonicTime() {
  timespec time;
  (void)clock_gettime(CLOCK_MONOTONIC, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

// A burst that is long enough that most of its times are not read from the clock.
TEST(TrcRecords, BearTheTimeOfTheMonotonicClock) {
  constexpr size_t kRecords = 60'000;
  constexpr uint64_t kTolerance = 2'000;
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    for (size_t i = 0; i < kRecords; ++i) {
      if (i % 20'000 == 0) usleep(2'000);  // after a pause, the clock is read again
      record(kEntry, kDoesFileExist, reinterpret_cast<const void*>(monotonicTime()));
    }
  });

  const std::string command = "babeltrace2 --clock-cycles --no-delta '" + temp.path("t") + "'";
  FILE* const output = popen(command.c_str(), "r");
  ASSERT_NE(output, nullptr);
  std::vector<uint64_t> times;
  std::vector<uint64_t> befores;
  char* line = nullptr;
  size_t size = 0;
  while (getline(&line, &size, output) > 0) {
    times.push_back(strtoull(field(line, "[", "]").c_str(), nullptr, 10));
    befores.push_back(strtoull(field(line, "object = ", " ").c_str(), nullptr, 16));
  }
  free(line);
  EXPECT_EQ(pclose(output), 0);

  ASSERT_THAT(times, SizeIs(kRecords));
  EXPECT_TRUE(std::is_sorted(times.begin(), times.end()));
  for (size_t i = 0; i < kRecords; ++i) {
    ASSERT_GE(times[i] + kTolerance, befores[i]) << i;
    if (i + 1 < kRecords) {
      ASSERT_LE(times[i], befores[i + 1] + kTolerance) << i;
    }
  }
}

std::chrono::nanoseconds realtime_before_monotonic{0};

int realtimeBehindMonotonic(clockid_t clock, timespec* time) {
  const int result = real::clock_gettime(CLOCK_MONOTONIC, time);
  if (clock != CLOCK_REALTIME) return result;
  const int64_t now =
      time->tv_sec * 1'000'000'000 + time->tv_nsec - realtime_before_monotonic.count();
  time->tv_sec = now / 1'000'000'000;
  time->tv_nsec = now % 1'000'000'000;
  return result;
}

// A machine without a battery-backed clock starts in 1970, and its monotonic clock may be ahead.
TEST(TrcRecords, BearTheTimeAlsoWhereTheMonotonicClockBeganBefore1970) {
  const TempDir temp;
  double before = 0;
  for (const auto behind : {std::chrono::milliseconds(250), std::chrono::milliseconds(750)}) {
    SCOPED_TRACE(behind.count());
    const std::string root = temp.path(std::to_string(behind.count()));
    ASSERT_EQ(inChild([&] {
                realtime_before_monotonic = behind;
                instead::clock_gettime = realtimeBehindMonotonic;
                if (traceInto(root) != 0) return 1;
                message("now");
                return 0;
              }),
              0);
    before = static_cast<double>(monotonicTime()) / 1e9 - static_cast<double>(behind.count()) / 1e3;

    const std::string metadata = contentsOf(entries(root).at(0) / "metadata");
    EXPECT_EQ(field(metadata, "offset_s = ", ";"), "-1");
    EXPECT_EQ(field(metadata, "; offset = ", ";").substr(0, 1) == "-", false);
    FILE* const output = popen(("babeltrace2 --clock-seconds '" + root + "'").c_str(), "r");
    ASSERT_NE(output, nullptr);
    double shown = 0;
    EXPECT_EQ(fscanf(output, "[%lf]", &shown), 1);
    pclose(output);
    EXPECT_LE(shown, before);
    EXPECT_GE(shown, before - 60);
  }
}

TEST(TrcRecords, TypesHaveNames) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    for (const uint64_t type : {0x3200000U, 0x32A0000U, 0x3210000U, 0x32B0000U, 0x30B0000U,
                                0x30C0000U, 0x3400000U, 0x3070000U}) {
      record(type, kDoesFileExist);
    }
  });

  std::vector<std::string> types;
  for (const Event& event : readEvents(temp.path("t"))) types.push_back(event.type);
  EXPECT_THAT(
      types, ElementsAre(
                 "\"entry\" : container = 0x3200000", "\"entry\" : container = 0x32A0000",
                 "\"exit\" : container = 0x3210000", "\"exit\" : container = 0x32B0000",
                 "\"exit_error\" : container = 0x30B0000", "\"exit_error\" : container = 0x30C0000",
                 "\"debug\" : container = 0x3400000", "\"debug_error\" : container = 0x3070000"));
}

TEST(TrcRecords, ANameCoversTheWholeLowByteOfItsId) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    for (const uint64_t id : {0x3E0600FFU, 0x3E060100U, 0x3E0601FFU, 0xC8010000U, 0xC80100FFU,
                              0xC8110000U, 0xC8120000U}) {
      record(kDebug, id);
      record(kDebug, id, &temp);  // with an object, the record has the wide form
    }
  });

  std::vector<std::string> functions;
  const std::vector<Event> events = readEvents(temp.path("t"));
  for (size_t i = 0; i < events.size(); i += 2) {
    functions.push_back(events[i].function);
    EXPECT_EQ(events[i + 1].function, events[i].function);
  }
  EXPECT_THAT(
      functions,
      ElementsAre("<unknown> : container = 0x3E0600FF",
                  "\"doesFileExist\" : container = 0x3E060100",
                  "\"doesFileExist\" : container = 0x3E0601FF",
                  "\"ldtr_fun\" : container = 0xC8010000", "\"ldtr_fun\" : container = 0xC80100FF",
                  "\"ldtr_fun\" : container = 0xC8110000", "<unknown> : container = 0xC8120000"));
}

TEST(TrcRecords, UnknownAndLargeNumbersAreKept) {
  const TempDir temp;
  const std::vector<uint64_t> numbers = {0,          1,           0x3FFFFFF, 0x4000000,
                                         0xFFFFFFFF, 0x100000000, UINT64_MAX};
  inTracingChild(temp.path("t"), [&] {
    for (const uint64_t number : numbers) {
      record(number, 7);
      record(7, number);
      record(7, 7, reinterpret_cast<void*>(number));
      trcWriteRec(number, number, reinterpret_cast<void*>(number), 4, "text", 0, 0, 0, 0);
    }
  });

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(numbers.size() * 4));
  for (size_t i = 0; i < numbers.size(); ++i) {
    char hex[32];
    snprintf(hex, sizeof hex, "0x%lX", static_cast<unsigned long>(numbers[i]));
    const std::string shown = std::string("<unknown> : container = ") + hex;
    SCOPED_TRACE(shown);
    EXPECT_EQ(events[4 * i].type, shown);
    EXPECT_EQ(events[4 * i + 1].function, shown);
    EXPECT_EQ(events[4 * i + 2].object, hex);
    EXPECT_EQ(events[4 * i + 3].type, shown);
    EXPECT_EQ(events[4 * i + 3].function, shown);
    EXPECT_EQ(events[4 * i + 3].object, hex);
    EXPECT_EQ(events[4 * i + 3].text, "text");
  }
}

TEST(TrcRecords, ExitRecordsCarryTheirCode) {
  const TempDir temp;
  const std::vector<long> codes = {0,    1,    -1,        89,        511,      512,
                                   -512, -513, INT32_MIN, INT64_MAX, INT64_MIN};
  inTracingChild(temp.path("t"), [&] {
    for (const long code : codes) {
      exitRecord(code);
      exitRecord(code, &temp);
    }
  });

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(codes.size() * 2));
  for (size_t i = 0; i < events.size(); ++i) {
    EXPECT_EQ(events[i].code, std::to_string(codes[i / 2]));
    EXPECT_EQ(events[i].object == "0x0", i % 2 == 0);
    EXPECT_EQ(events[i].function, "\"doesFileExist\" : container = 0x3E060100");
  }
}

TEST(TrcRecords, TextsOfAllLengths) {
  constexpr size_t kLongestText = 64 << 10;
  const TempDir temp;
  const std::vector<size_t> lengths = {
      1, 2, 7, 8, 9, 4096, 30000, 65000, kLongestText, kLongestText + 1};
  inTracingChild(temp.path("t"), [&] {
    for (const size_t length : lengths) message(std::string(length - 1, 'x') + "!");
  });

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(lengths.size()));
  for (size_t i = 0; i + 1 < lengths.size(); ++i) {
    EXPECT_TRUE(events[i].text == std::string(lengths[i] - 1, 'x') + "!") << lengths[i];
  }
  EXPECT_TRUE(events.back().text == std::string(kLongestText, 'x'));
}

TEST(TrcRecords, UnusualTexts) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("");
    trcWriteRec(kDebug, kDoesFileExist, nullptr, 100, nullptr, 0, 0, 0, 0);
    message("Gr\u00fc\u00dfe");
    message(std::string_view("one\0two", 7));
    message("12345678");  // as long as an exit code, but not in an exit record
    trcWriteRec(kExit, kDoesFileExist, nullptr, 3, "odd", 0, 0, 0, 0);
    message("last");
  });

  EXPECT_THAT(texts(readEvents(temp.path("t"))),
              ElementsAre("", "", "Gr\u00fc\u00dfe", "one", "12345678", "odd", "last"));
  // The reader shows a text up to its first NUL; the file has all of it.
  const fs::path trace = entries(temp.path("t")).at(0);
  std::string files;
  for (const fs::path& path : entries(trace)) files += contentsOf(path);
  EXPECT_THAT(files, HasSubstr(std::string("one\0two", 7)));
}

TEST(TrcRecords, TwoProcessesMergeInOrderOfTime) {
  const TempDir temp;
  int first_to_second[2];
  int second_to_first[2];
  ASSERT_EQ(pipe(first_to_second), 0);
  ASSERT_EQ(pipe(second_to_first), 0);
  // The two processes alternate.
  const auto run = [&](const char* name, int from, int to, bool begins) {
    const pid_t pid = fork();
    if (pid != 0) return pid;
    char turn = 0;
    bool good = traceInto(temp.path("t")) == 0;
    for (int i = 0; i < 50 && good; ++i) {
      if (i > 0 || !begins) good = ::read(from, &turn, 1) == 1;
      message(name + std::to_string(i));
      if (i < 49 || begins) good = good && write(to, &turn, 1) == 1;
    }
    _exit(good ? 0 : 1);
  };
  const pid_t first = run("a", second_to_first[0], first_to_second[1], true);
  const pid_t second = run("b", first_to_second[0], second_to_first[1], false);
  for (const pid_t pid : {first, second}) {
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_EQ(status, 0);
  }
  for (const int fd :
       {first_to_second[0], first_to_second[1], second_to_first[0], second_to_first[1]}) {
    close(fd);
  }

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(100));
  for (int i = 0; i < 100; ++i) {
    const Event& event = events[static_cast<size_t>(i)];
    EXPECT_EQ(event.text, (i % 2 == 0 ? "a" : "b") + std::to_string(i / 2));
    EXPECT_EQ(event.pid, i % 2 == 0 ? first : second);
  }
}

}  // namespace
