// The bounds of what the trace commands read and print: times, durations, names, counts.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "made_trace.h"
#include "tool.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;
using Json = nlohmann::json;

class TraceValues : public ::testing::Test {
 protected:
  Result run(Arguments arguments) {
    arguments.insert(arguments.begin(), "trace");
    arguments.push_back(temp.path("t"));
    return osutils(arguments);
  }
  std::string outOf(const Arguments& arguments) {
    const Result result = run(arguments);
    EXPECT_EQ(result.status, 0) << result.err;
    return result.out;
  }
  Json summary(Arguments options = {}) {
    options.insert(options.begin(), {"summary", "--json"});
    return Json::parse(outOf(options));
  }
  // In the order in which they end.
  std::vector<Json> lines(Arguments options = {}) {
    options.insert(options.begin(), {"export", "--format", "jsonl"});
    std::istringstream text(outOf(options));
    std::vector<Json> objects;
    for (std::string line; std::getline(text, line);) objects.push_back(Json::parse(line));
    return objects;
  }
  void expectUsage(const Arguments& arguments, const std::string& line) {
    const Result result = run(arguments);
    EXPECT_EQ(result.status, 2);
    EXPECT_THAT(result.err, HasSubstr(line + "\n"));
  }

  const TempDir temp;
};

// ---- Times ----

TEST_F(TraceValues, FromTakesTheNanosecond) {
  constexpr uint64_t kTime = 1'700'000'000 * kSecond + 123'456'789;
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kTime, kCopyFile).leave(kTime + 5, kCopyFile, 1)});
  const auto calls = [&](const char* option, const char* time) {
    return lines({option, time}).size();
  };
  EXPECT_EQ(calls("--from", "2023-11-14T22:13:20.123456789Z"), 1U);
  EXPECT_EQ(calls("--from", "2023-11-14T22:13:20.12345679"), 0U);
  EXPECT_EQ(calls("--to", "2023-11-14T22:13:20.123456789"), 0U);
  EXPECT_EQ(calls("--to", "2023-11-14T22:13:20.12345679Z"), 1U);
  EXPECT_EQ(calls("--from", "2023-11-14T22:12:60"), 1U);  // the second before a new minute
  EXPECT_EQ(calls("--from", "2023-11-14T22:13:60"), 0U);
}

TEST_F(TraceValues, TimesHaveBounds) {
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  for (const char* const time : {"1678-01-01T00:00:00", "1970-01-01T00:00:00"}) {
    EXPECT_EQ(lines({"--from", time}).size(), 1U) << time;
  }
  for (const char* const time : {"2261-12-31T23:59:60.999999999Z", "1970-12-31T23:59:59.9"}) {
    EXPECT_EQ(lines({"--from", time}).size(), 0U) << time;
  }
  for (const std::string time : {"1677-12-31T23:59:59",   "2262-01-01T00:00:00",
                                 "1970-00-01T00:00:00",   "1970-13-01T00:00:00",
                                 "1970-01-00T00:00:00",   "1970-01-32T00:00:00",
                                 "1970-01-01T24:00:00",   "1970-01-01T00:60:00",
                                 "1970-01-01T00:00:61",   "1970-01-01 00:00:00",
                                 "1970-01-01T00:00:0",    "1970-01-01T00:00:0Z",
                                 "1970-01-01T00:00:0/",   "1970-01-01T00:00:0:",
                                 "1970-01-01T00:00:00ZZ", "1970-01-01T00:00:00x",
                                 "1970-01-01T00:00:00x5", "1970-01-01T00:00:00.5/",
                                 "1970-01-01T00:00:00.:", "1970-01-01T00:00:00.1234567891"}) {
    SCOPED_TRACE(time);
    expectUsage({"summary", "--to", time},
                "--to is not a time like 2026-01-31T12:00:00.5Z: \"" + time + "\"");
  }
}

TEST_F(TraceValues, CallsBeforeAndAfterTheRangeAreNotCallsAround) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(1 * kSecond, kCopyFile)
                                 .message(2 * kSecond, kCopyFile + 1, "early")
                                 .enter(3 * kSecond, kCheckFilePerms)
                                 .message(4 * kSecond, kCheckFilePerms + 1, "inside")
                                 .enter(5 * kSecond, kIsDirectory)
                                 .leave(6 * kSecond, kIsDirectory, 1)
                                 .leave(7 * kSecond, kCheckFilePerms, 0)
                                 .leave(8 * kSecond, kCopyFile, 1)
                                 .leave(9 * kSecond, kIsDirectory, 1)
                                 .message(9 * kSecond, kCopyFile + 1, "late")});
  EXPECT_EQ(outOf({"tree", "--from", "1970-01-01T00:00:03", "--to", "1970-01-01T00:00:05"}),
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:03.000000000  checkFilePerms  4.00s  = 0\n"
            "00:00:04.000000000    - inside\n");
  EXPECT_EQ(outOf({"tree", "--from", "1970-01-01T00:00:05"}),
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:05.000000000  isDirectory  1.00s  = 1\n"
            "00:00:09.000000000  isDirectory  = 1  WITHOUT ENTRY\n"
            "00:00:09.000000000  - late\n");
}

TEST_F(TraceValues, ADayHasALineOfItsOwn) {
  constexpr uint64_t kDay = 24 * 3600 * kSecond;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kDay - 1, kCopyFile)
                                 .leave(kDay, kCopyFile, 1)
                                 .enter(kDay, kIsDirectory)
                                 .leave(kDay + 1, kIsDirectory, 1)});
  EXPECT_EQ(outOf({"tree"}),
            "host program process 7 thread 70 1970-01-01\n"
            "23:59:59.999999999  copyFile  1ns  = 1\n"
            "host program process 7 thread 70 1970-01-02\n"
            "00:00:00.000000000  isDirectory  1ns  = 1\n");
}

// ---- Durations ----

TEST_F(TraceValues, DurationsHaveThreeDigits) {
  const std::vector<std::pair<uint64_t, std::string>> durations = {
      {999, "999ns"},        {1'000, "1.00us"},       {9'990, "9.99us"},
      {10'000, "10.0us"},    {99'900, "99.9us"},      {100'000, "100us"},
      {1'000'000, "1.00ms"}, {99'900'000, "99.9ms"},  {100'000'000, "100ms"},
      {kSecond, "1.00s"},    {10 * kSecond, "10.0s"}, {1234 * kSecond, "1234s"}};
  MadeStream stream(70);
  uint64_t now = kSecond;
  for (const auto& [duration, text] : durations) {
    stream.enter(now, kCopyFile).leave(now + duration, kCopyFile, 1);
    now += duration + 1;
  }
  makeTrace(temp.path("t"), {stream});

  std::istringstream out(outOf({"tree"}));

  std::string line;
  std::getline(out, line);  // the thread's
  for (const auto& [duration, text] : durations) {
    std::getline(out, line);
    EXPECT_THAT(line, HasSubstr("  copyFile  " + text + "  = 1"));
  }
}

TEST_F(TraceValues, MinTimeHasFourUnits) {
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kSecond, kCopyFile).leave(2 * kSecond, kCopyFile, 1)});
  const auto isShown = [&](const char* time) {
    return !outOf({"tree", "--min-time", time}).empty();
  };
  for (const char* const time : {"1000000000ns", "1000000us", "1000000.000us", "1000ms", "1s",
                                 "0.999999999s", "1.000000000s", "0s", "0ns"}) {
    EXPECT_TRUE(isShown(time)) << time;
  }
  for (const char* const time :
       {"1000000001ns", "1000000.001us", "1000.000001ms", "1.000000001s", "2s", "1000000000s",
        "1000000000.999999999s", "1500000000us", "1000000000000ms", "1000000000000000000ns"}) {
    EXPECT_FALSE(isShown(time)) << time;
  }
  for (const std::string time : {"1000000001s", "1000000000001ms", "1000000000000001us",
                                 "1000000000000000001ns", "", "1", "1m", "ms", ".5s", "1.s", "1.5",
                                 "1/s", "1:s", "1.2.3s", "1.2/s", "-1s", "+1s", "1 s", "1S"}) {
    SCOPED_TRACE(time);
    expectUsage({"tree", "--min-time", time},
                "--min-time is not a time like 5ms, 0.5s, 20us or 100ns: \"" + time + "\"");
  }
}

// ---- Names ----

TEST_F(TraceValues, NamesAreSeparatedByBlanksAndTabs) {
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(100, kOwn).leave(200, kOwn, 0).enter(300, 77).leave(301, 77, 0)});
  temp.file("names", " \t\r\n \t# 77 comment\n#\n\t0X12340000\tmigrate\tusers \t\r\n77 stop");
  const std::vector<Json> calls = lines({"--names", temp.path("names")});
  ASSERT_EQ(calls.size(), 2U);
  EXPECT_EQ(calls[0]["function"], "migrate\tusers");
  EXPECT_EQ(calls[1]["function"], "stop");

  const auto fails = [&](const std::string& path, const std::string& line) {
    expectFailure(run({"summary", "--names", path}), "osutils: trace summary: " + line + "\n");
  };
  const std::string pipe = temp.path("pipe");
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  fails(pipe, "unwilling to perform (53): " + pipe + " is not a regular file");
  const std::string folder = temp.dir("folder");
  fails(folder, "cannot read the names in " + folder +
                    "; checkFilePerms returns constraint violation (19) for " + folder);
  const std::string missing = temp.path("missing");
  fails(missing, "cannot read the names in " + missing +
                     "; checkFilePerms returns no such object (32) for " + missing);
}

TEST_F(TraceValues, ANameIsThatOfTheNumberOrOfTheTraceOrOfTheTable) {
  std::string metadata = kMadeMetadata;
  const std::string number = "number64 function;";
  for (size_t at = 0; (at = metadata.find(number, at)) != std::string::npos;) {
    metadata.replace(at, number.size(),
                     "enum : number64 { \"own\" = 0x12340000, \"other\" = 0x12350000,\n"
                     "  \"wrong\" = 0x3E060700 } function;");
  }
  makeTrace(temp.path("t"),
            {MadeStream(70)
                 .message(1, trace::kOrdinaryLevel, "a")
                 .message(2, trace::kErrorLevel, "b", trace::kDebugError)
                 .message(3, kOwn + 1, "c")
                 .message(4, kCopyFile + 1, "d")
                 .enter(5, kOwn)
                 .leave(6, kOwn, 0)
                 .enter(7, 0x12350000)
                 .leave(8, 0x12350000, 0)
                 .enter(9, UINT64_MAX)
                 .leave(10, UINT64_MAX, 0)
                 .enter(11, kCopyFile)
                 .leave(12, kCopyFile, 1)},
            metadata);
  ASSERT_EQ(kCopyFile, 0x3E060700U);
  temp.file("names", "0x12350000 named\n0x3E060701 message of copyFile\n");

  const std::vector<Json> found = lines({"--names", temp.path("names")});

  std::vector<std::string> names;
  for (const Json& each : found) names.push_back(each["function"]);
  EXPECT_EQ(names,
            (std::vector<std::string>{"ldtr_fun", "ldtr_fun", "0x12340001", "message of copyFile",
                                      "own", "named", "0xffffffffffffffff", "copyFile"}));
  EXPECT_EQ(found[1]["error"], true);
}

TEST_F(TraceValues, ATraceWithoutAnEnvironmentHasEmptyNames) {
  std::string metadata = kMadeMetadata;
  metadata.erase(metadata.find("env {"), metadata.find("clock {") - metadata.find("env {"));
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)},
            metadata);
  const std::vector<Json> calls = lines();
  ASSERT_EQ(calls.size(), 1U);
  EXPECT_EQ(calls[0]["host"], "");
  EXPECT_EQ(calls[0]["program"], "");
  EXPECT_EQ(calls[0]["pid"], 0);
  EXPECT_EQ(outOf({"export", "--format", "folded"}), "?;copyFile 100\n");
  const Json events = Json::parse(outOf({"export", "--format", "chrome"}))["traceEvents"];
  EXPECT_EQ(events[0]["args"]["name"], " 0");
}

// ---- The summary ----

TEST_F(TraceValues, PercentilesOfShortCallsAreExact) {
  MadeStream stream(70);
  uint64_t now = 1;
  const auto add = [&](uint64_t function, uint64_t duration) {
    stream.enter(now, function).leave(now + duration, function, 0);
    now += duration + 1;
  };
  for (uint64_t duration = 1; duration <= 100; ++duration) add(kIsDirectory, duration);
  for (uint64_t duration = 1; duration <= 99; ++duration) add(kCheckFilePerms, duration);
  const uint64_t first = now;
  for (const uint64_t duration : {7U, 5U, 7U}) add(kCopyFile, duration);
  for (const uint64_t duration : {0U, 0U, 5U}) add(kOwn, duration);
  makeTrace(temp.path("t"), {stream});

  const Json functions = summary()["functions"];

  ASSERT_EQ(functions.size(), 4U);
  EXPECT_EQ(functions[0]["median"], 50);
  EXPECT_EQ(functions[0]["p99"], 99);
  EXPECT_EQ(functions[0]["mean"], 50);
  EXPECT_EQ(functions[1]["median"], 50);
  EXPECT_EQ(functions[1]["p99"], 99);
  EXPECT_EQ(functions[2]["median"], 7);
  EXPECT_EQ(functions[2]["p99"], 7);
  EXPECT_EQ(functions[2]["mean"], 6);
  EXPECT_EQ(functions[2]["longest"], 7);
  EXPECT_EQ(functions[2]["longest_at"], first);  // of two
  EXPECT_EQ(functions[3]["median"], 0);
  EXPECT_EQ(functions[3]["p99"], 5);
}

// The median of three calls, for each thread another one.
TEST_F(TraceValues, PercentilesOfLongCallsAreNear) {
  std::vector<uint64_t> times = {1, 127, 128, 129, 254, 255, 256, 257, 258, 511, 512, 513};
  for (unsigned power = 10; power < 56; power += 5) {
    for (const uint64_t add : {uint64_t{0}, (uint64_t{1} << power) / 3}) {
      times.push_back((uint64_t{1} << power) - 1 + add);
      times.push_back((uint64_t{1} << power) + add);
    }
  }
  std::vector<MadeStream> streams;
  for (size_t i = 0; i < times.size(); ++i) {
    MadeStream stream(1000 + i);
    uint64_t now = 1;
    for (const uint64_t time : {times[i] / 2, times[i], 2 * times[i]}) {
      stream.enter(now, kIsDirectory).leave(now + time, kIsDirectory, 1);
      now += time + 1;
    }
    streams.push_back(stream);
  }
  makeTrace(temp.path("t"), streams);

  const Json threads = summary({"--by", "thread"})["threads"];

  ASSERT_EQ(threads.size(), times.size());
  for (const Json& row : threads) {
    const uint64_t time = times[row["tid"].get<uint64_t>() - 1000];
    const uint64_t median = row["median"].get<uint64_t>();
    EXPECT_LE(std::max(median, time) - std::min(median, time), time / 256) << time;
  }
}

TEST_F(TraceValues, FunctionsWithoutATimeComeAfterThoseWithoutALength) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(100, kCopyFile)
                                 .leave(100, kCopyFile, 1)
                                 .leave(200, kCheckFilePerms, 0)});
  for (const char* const key : {"mean", "median", "p99"}) {
    const Json functions = summary({"--sort", key})["functions"];
    ASSERT_EQ(functions.size(), 2U);
    EXPECT_EQ(functions[0]["function"], "copyFile") << key;
    EXPECT_EQ(functions[0][key], 0);
    EXPECT_EQ(functions[1][key], Json());
  }
  // Without a difference the names decide.
  for (const char* const key : {"total", "own", "longest", "calls", "failures", "function"}) {
    EXPECT_EQ(summary({"--sort", key})["functions"][0]["function"], "checkFilePerms") << key;
  }
}

TEST_F(TraceValues, EqualValuesAreSortedByName) {
  for (const bool is_reversed : {false, true}) {
    const uint64_t one = is_reversed ? kCopyFile : kCheckFilePerms;
    const uint64_t other = is_reversed ? kCheckFilePerms : kCopyFile;
    makeTrace(
        temp.path("t"),
        {MadeStream(70).enter(100, one).leave(150, one, 1).enter(200, other).leave(250, other, 1)});
    for (const char* const key : {"total", "own", "mean", "median", "p99", "longest", "calls"}) {
      EXPECT_EQ(summary({"--sort", key})["functions"][0]["function"], "checkFilePerms") << key;
    }
  }
}

TEST_F(TraceValues, EachKeySortsByItsOwnValue) {
  const auto name = [&](const char* key) {
    return summary({"--sort", key})["functions"][0]["function"].get<std::string>();
  };
  MadeStream stream(70);
  uint64_t now = 1;
  const auto add = [&](uint64_t function, const std::vector<uint64_t>& times, int64_t code,
                       uint64_t inside = 0) {
    for (const uint64_t time : times) {
      stream.enter(now, function);
      if (inside != 0) stream.enter(now, 6).leave(now + inside, 6, 0);
      stream.leave(now + time, function, code);
      now += time + 1;
    }
  };
  add(1, std::vector<uint64_t>(10, 100), 0, 99);
  add(2, {300, 1, 1, 1, 1}, 0, 0);          // the longest
  add(3, {150, 160, 1}, 0, 80);             // the largest median
  add(4, std::vector<uint64_t>(11, 1), 0);  // the most calls, but for those inside
  add(5, {140}, 0, 5);                      // the largest mean
  makeTrace(temp.path("t"), {stream});
  const Json rows = summary({"--sort", "function"})["functions"];
  for (const std::string key : {"total", "own", "mean", "median", "p99", "longest", "calls"}) {
    const auto largest = std::max_element(
        rows.begin(), rows.end(), [&](const Json& a, const Json& b) { return a[key] < b[key]; });
    EXPECT_EQ(name(key.c_str()), (*largest)["function"].get<std::string>()) << key;
  }
  EXPECT_EQ(name("longest"), "0x2");
  EXPECT_EQ(name("median"), "0x3");
  EXPECT_EQ(name("mean"), "0x5");
}

TEST_F(TraceValues, TheTableHasADashForWhatIsNotKnown) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .leave(1, kCheckFilePerms, 50)
                                 .leave(2, kCheckFilePerms, 32)
                                 .leave(3, kCheckFilePerms, 32)
                                 .enter(100, kCopyFile)});
  EXPECT_EQ(outOf({"summary"}),
            "FUNCTION        CALLS  UNFINISHED  UNKNOWN  FAILURES   TOTAL  OWN  MEAN  MEDIAN  P99  "
            "LONGEST  LONGEST_AT\n"
            "checkFilePerms  3      0           0        32:2 50:1  -      -    -     -       -    "
            "-        -\n"
            "copyFile        1      1           0        -          -      -    -     -       -    "
            "-        -\n");
  EXPECT_EQ(outOf({"summary", "--by", "thread", "--errors"}),
            "HOST  PROGRAM  PID  TID  CALLS  UNFINISHED  UNKNOWN  FAILURES   TOTAL  OWN  MEAN  "
            "MEDIAN  P99  LONGEST  LONGEST_AT\n"
            "host  program  7    70   4      1           0        32:2 50:1  -      -    -     "
            "-       -    -        -\n");
}

TEST_F(TraceValues, WrongOptionsAreNamed) {
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  expectUsage({"summary", "--by", "host"}, "--by is not process, thread or function: \"host\"");
  expectUsage({"summary", "--sort", "size"}, "--sort is not a key of this summary: \"size\"");
  expectUsage({"export"}, "--format is missing: chrome, folded or jsonl");
  expectUsage({"export", "--format", "x"}, "--format is not chrome, folded or jsonl: \"x\"");
  expectUsage({"export", "--json", "--format", "jsonl"}, "--json excludes --format");
}

// ---- The other views ----

TEST_F(TraceValues, AnExitWithoutAnEntryKeepsTheCallAroundIt) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(100, kCopyFile)
                                 .leave(110, kCheckFilePerms, 32)
                                 .leave(200, kCopyFile, 1)
                                 .enter(300, kCopyFile)
                                 .leave(310, kCheckFilePerms, 0)
                                 .leave(400, kCopyFile, 1)
                                 .enter(500, kIsDirectory)});
  EXPECT_EQ(outOf({"tree", "--only-failed"}),
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000100  copyFile  100ns  = 1\n"
            "00:00:00.000000110    checkFilePerms  = 32  WITHOUT ENTRY  FAILED\n");
}

TEST_F(TraceValues, MessagesLoseBlanksAtTheirEnds) {
  makeTrace(temp.path("t"),
            {MadeStream(70).message(1, kCopyFile + 1, " a \n \n").message(2, kCopyFile + 1, "")});
  EXPECT_EQ(outOf({"tree"}),
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000001  -  a\n"
            "00:00:00.000000002  - \n");
}

TEST_F(TraceValues, ACallIsWrittenBeforeItsEndWhenAHundredThousandLinesWait) {
  for (const bool is_one_more : {false, true}) {
    MadeStream stream(70);
    stream.enter(1, kCopyFile);
    const uint64_t inside = 99'998 + (is_one_more ? 1 : 0);
    for (uint64_t i = 0; i < inside; ++i) {
      stream.leave(2 + i, kIsDirectory, 1);
    }
    stream.leave(200'000, kCopyFile, 1);
    makeTrace(temp.path("t"), {stream});
    const std::string out = outOf({"tree"});
    EXPECT_EQ(out.find("CONTINUES") != std::string::npos, is_one_more);
  }
}

TEST_F(TraceValues, TheFirstMomentIsThatOfAnyRecord) {
  const auto start = [&](const MadeStream& first) {
    makeTrace(
        temp.path("t"),
        {MadeStream(70).enter(500 * kSecond, kCopyFile).leave(600 * kSecond, kCopyFile, 1), first});
    return Json::parse(outOf({"export", "--format", "chrome"}))["otherData"]["start"];
  };
  EXPECT_EQ(start(MadeStream(71).message(3 * kSecond, kCopyFile + 1, "a")),
            "1970-01-01T00:00:03.000000000Z");
  EXPECT_EQ(start(MadeStream(71).leave(4 * kSecond, kCopyFile, 1)),
            "1970-01-01T00:00:04.000000000Z");
  EXPECT_EQ(start(MadeStream(71).enter(5 * kSecond, kCopyFile)), "1970-01-01T00:00:05.000000000Z");
}

TEST_F(TraceValues, ProcessesWithOneIdGetOthersInChromesFormat) {
  for (const std::string host : {"a", "b", "c"}) {
    std::string metadata = kMadeMetadata;
    metadata.replace(metadata.find("\"host\""), 6, '"' + host + '"');
    makeTrace(temp.path("t/" + host),
              {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)}, metadata);
  }
  const Json events = Json::parse(outOf({"export", "--format", "chrome"}))["traceEvents"];
  std::vector<int> ids;
  for (const Json& event : events) {
    if (event["name"] == "copyFile") ids.push_back(event["pid"]);
  }
  EXPECT_EQ(ids, (std::vector<int>{7, 1 << 22, (1 << 22) + 1}));
}

// With less than the stream's buffer, and with more.
TEST_F(TraceValues, AFullDiskIsNamed) {
  const auto fullDisk = [] {
    const int full = open("/dev/full", O_WRONLY);
    if (full == -1 || dup2(full, STDOUT_FILENO) == -1) _exit(126);
  };
  const std::string failure =
      ": operations error (1): cannot write to standard output: No space left on device\n";
  for (const uint64_t calls : {1U, 2000U}) {
    SCOPED_TRACE(calls);
    MadeStream stream(70);
    for (uint64_t i = 1; i <= calls; ++i) {
      stream.enter(2 * i, kCopyFile).leave(2 * i + 1, kCopyFile, 1);
    }
    makeTrace(temp.path("t"), {stream});
    expectFailure(osutils({"trace", "tree", temp.path("t")}, fullDisk),
                  "osutils: trace tree" + failure);
    expectFailure(osutils({"trace", "export", "--format", "jsonl", temp.path("t")}, fullDisk),
                  "osutils: trace export" + failure);
  }
}

// ---- Folders ----

TEST_F(TraceValues, AFolderIsReadOnceAndHiddenAndLinkedOnesAreNotRead) {
  const std::vector<MadeStream> streams = {
      MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)};
  makeTrace(temp.path("t/b"), streams);
  makeTrace(temp.path("t/b/c"), streams);
  makeTrace(temp.path("t/.hidden"), streams);
  makeTrace(temp.path("other"), streams);
  std::filesystem::create_directory_symlink(temp.path("other"), temp.path("t/link"));
  writeFile(temp.path("t/b/.hidden"), "not a stream");
  std::filesystem::create_directories(temp.path("t/d/metadata"));

  const Json answer = summary({temp.path("t/b")});

  EXPECT_EQ(answer["traces"], 2);
  EXPECT_EQ(answer["records"], 4);
  EXPECT_EQ(answer["unreadable"], 0);
}

TEST_F(TraceValues, TheFirstTenProblemsHaveALine) {
  for (const int files : {10, 12}) {
    std::vector<MadeStream> streams;
    for (int i = 0; i <= files; ++i) {
      streams.push_back(
          MadeStream(70 + static_cast<uint64_t>(i)).enter(100, kCopyFile).leave(200, kCopyFile, 1));
    }
    makeTrace(temp.path("t"), streams);
    for (int i = 0; i < files; ++i) {
      std::filesystem::resize_file(temp.path("t/stream-" + std::to_string(i)), 100);
    }
    const Result result = osutils({"trace", "summary", "--json", temp.path("t")},
                                  [this] { setenv("TMPDIR", temp.path().c_str(), 1); });
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), files == 10 ? 10 : 11);
    EXPECT_EQ(result.err.find("osutils: trace summary: and 2 more that could not be read\n") !=
                  std::string::npos,
              files == 12)
        << result.err;
    EXPECT_EQ(Json::parse(result.out)["unreadable"], files);
  }
}

TEST_F(TraceValues, OneRecordIsMissingAndOneEventIsNotAFunctions) {
  makeTrace(temp.path("t"),
            {MadeStream(70).other(50).enter(100, kCopyFile).discard(1).leave(200, kCopyFile, 1)});
  const Result result = run({"summary"});
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err,
            "osutils: trace summary: 1 event not of traced functions left out\n"
            "osutils: trace summary: 1 record missing: the tracer discarded them\n");
}

}  // namespace
