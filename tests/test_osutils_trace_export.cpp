// trace export, on traces of the tests' own.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>

#include <nlohmann/json.hpp>
#include <set>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "made_trace.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;
using Json = nlohmann::json;

constexpr const char* kBadText = "\"\\\x1b[31m</script>\n\xff\xc3\xa9";
constexpr const char* kBadTextInUtf8 = "\"\\\x1b[31m</script>\n\xef\xbf\xbd\xc3\xa9";

class TraceExport : public ::testing::Test {
 protected:
  std::string exported(const char* format, Arguments options = {}) {
    options.insert(options.begin(), {"trace", "export", "--format", format});
    options.push_back(temp.path("t"));
    const Result result = osutils(options);
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, "");
    return result.out;
  }
  std::vector<Json> lines(const Arguments& options = {}) {
    std::istringstream text(exported("jsonl", options));
    std::vector<Json> objects;
    for (std::string line; std::getline(text, line);) objects.push_back(Json::parse(line));
    return objects;
  }
  Json events(const Arguments& options = {}) {
    return Json::parse(exported("chrome", options))["traceEvents"];
  }
  // Without the names of processes and threads.
  std::vector<Json> eventsOfCalls() {
    std::vector<Json> calls;
    for (const Json& event : events()) {
      if (event["ph"] != "M") calls.push_back(event);
    }
    return calls;
  }

  void makeCalls() {
    makeTrace(temp.path("t"),
              {MadeStream(70)
                   .enter(kBegin, kCopyFile)
                   .message(kBegin + 1'005, kCopyFile + 1, kBadText)
                   .enter(kBegin + 2'000, kCheckFilePerms)
                   .message(kBegin + 2'100, kCheckFilePerms + 0x11, "no", trace::kDebugError)
                   .leave(kBegin + 5'007, kCheckFilePerms, 32)
                   .enter(kBegin + 6'000, kIsDirectory)
                   .enter(kBegin + 6'010, kOwn)
                   .leave(kBegin + 6'030, kOwn, std::nullopt)
                   .leave(kBegin + 3 * kSecond, kCopyFile, 1)
                   .leave(kBegin + 4 * kSecond, kCheckFilePerms, 0)
                   .enter(kBegin + 5 * kSecond, kCopyFile)});
  }

  void makeManyCalls(uint64_t calls) {
    MadeStream stream(70);
    for (uint64_t i = 0; i < calls; ++i) {
      if (i % 10'000 == 9'999) stream.endPacket();
      stream.enter(kBegin + 3 * i, kCopyFile)
          .message(kBegin + 3 * i + 1, kCopyFile + 1, "text")
          .leave(kBegin + 3 * i + 2, kCopyFile, 1);
    }
    makeTrace(temp.path("t"), {stream});
  }

  const TempDir temp;
};

TEST_F(TraceExport, ChromeHasCompleteEventsUnfinishedOnesAndInstants) {
  makeCalls();
  const Json event = {{"pid", 7}, {"tid", 70}};
  const auto with = [&event](Json rest) {
    rest.update(event);
    return rest;
  };
  const std::vector<Json> expected = {
      with({{"ph", "i"},
            {"s", "t"},
            {"name", "message"},
            {"ts", 1.005},
            {"args", {{"function", "copyFile"}, {"text", kBadTextInUtf8}}}}),
      with({{"ph", "i"},
            {"s", "t"},
            {"name", "error message"},
            {"ts", 2.1},
            {"args", {{"function", "checkFilePerms"}, {"text", "no"}}}}),
      with({{"ph", "X"},
            {"name", "checkFilePerms"},
            {"ts", 2.0},
            {"dur", 3.007},
            {"args", {{"code", 32}, {"failed", true}}}}),
      with({{"ph", "X"},
            {"name", "0x12340000"},
            {"ts", 6.01},
            {"dur", 0.02},
            {"args", Json::object()}}),
      with({{"ph", "B"}, {"name", "isDirectory"}, {"ts", 6.0}}),
      with({{"ph", "X"}, {"name", "copyFile"}, {"ts", 0.0}, {"dur", 3e6}, {"args", {{"code", 1}}}}),
      with({{"ph", "i"},
            {"s", "t"},
            {"name", "checkFilePerms"},
            {"ts", 4e6},
            {"args", {{"code", 0}}}}),
      with({{"ph", "B"}, {"name", "copyFile"}, {"ts", 5e6}})};

  EXPECT_THAT(eventsOfCalls(), ::testing::ElementsAreArray(expected));
}

TEST_F(TraceExport, ChromeSaysWhenItBeginsAndWhoseCallsTheyAre) {
  makeCalls();
  const Json trace = Json::parse(exported("chrome"));
  EXPECT_EQ(trace["displayTimeUnit"], "ns");
  EXPECT_EQ(trace["otherData"]["start"], "2023-11-14T22:13:20.000000000Z");
  EXPECT_EQ(trace["traceEvents"][0], Json({{"ph", "M"},
                                           {"name", "process_name"},
                                           {"pid", 7},
                                           {"tid", 0},
                                           {"args", {{"name", "program 7 on host"}}}}));
  EXPECT_EQ(trace["traceEvents"][1], Json({{"ph", "M"},
                                           {"name", "thread_name"},
                                           {"pid", 7},
                                           {"tid", 70},
                                           {"args", {{"name", "thread 70"}}}}));
}

// The first is in the stream that is read last.
TEST_F(TraceExport, ChromeCountsFromTheFirstCallOfAllThreads) {
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kBegin + 500, kCopyFile).leave(kBegin + 600, kCopyFile, 1),
             MadeStream(71).enter(kBegin, kCopyFile).leave(kBegin + 100, kCopyFile, 1)});
  std::set<double> times;
  for (const Json& event : eventsOfCalls()) times.insert(event["ts"].get<double>());
  EXPECT_EQ(times, (std::set<double>{0.0, 0.5}));
}

TEST_F(TraceExport, ChromeKeepsProcessesWithTheSameIdApart) {
  const auto add = [&](const char* host) {
    std::string metadata = kMadeMetadata;
    const std::string_view made = "hostname = \"host\"";
    metadata.replace(metadata.find(made), made.size(), std::string("hostname = \"") + host + '"');
    makeTrace(temp.path(std::string("t/") + host),
              {MadeStream(70).enter(kBegin, kCopyFile).leave(kBegin + 100, kCopyFile, 1)},
              metadata);
  };
  add("one");
  add("two");

  std::set<std::pair<int, std::string>> names;
  for (const Json& event : events()) {
    if (event["name"] == "process_name") names.emplace(event["pid"], event["args"]["name"]);
  }
  std::set<int> ids;
  for (const Json& event : eventsOfCalls()) ids.insert(event["pid"].get<int>());

  EXPECT_THAT(names, ::testing::SizeIs(2));
  EXPECT_EQ(ids, (std::set<int>{7, 4'194'304}));
  std::set<std::string> texts;
  for (const auto& [id, name] : names) texts.insert(name);
  EXPECT_EQ(texts, (std::set<std::string>{"program 7 on one", "program 7 on two"}));
}

TEST_F(TraceExport, ChromeOfNoCallsIsAnEmptyList) {
  makeCalls();
  const Json trace = Json::parse(exported("chrome", {"--to", "2001-01-01T00:00:00"}));
  EXPECT_EQ(trace["traceEvents"], Json::array());
  EXPECT_EQ(trace["otherData"]["start"], "1970-01-01T00:00:00.000000000Z");
}

TEST_F(TraceExport, FoldedHasTheOwnTimeOfEachStack) {
  makeCalls();
  EXPECT_EQ(exported("folded"),
            "program;copyFile 2993\n"
            "program;copyFile;checkFilePerms 3007\n"
            "program;copyFile;isDirectory;0x12340000 20\n");
}

TEST_F(TraceExport, FoldedAddsThreadsAndKeepsFramesApart) {
  makeTrace(
      temp.path("t"),
      {MadeStream(70).enter(100, kOwn).leave(130, kOwn, 0).enter(140, kOwn).leave(150, kOwn, 0),
       MadeStream(71)
           .enter(100, kOwn)
           .enter(110, kCopyFile)
           .leave(115, kCopyFile, 1)
           .leave(120, kOwn, 0)});
  temp.file("names", "0x12340000 a;b\x1b c\n");
  EXPECT_EQ(exported("folded", {"--names", temp.path("names")}),
            "program;a:b? c 55\n"
            "program;a:b? c;copyFile 5\n");
}

TEST_F(TraceExport, LinesHaveTheObjectsOfTheTree) {
  makeCalls();
  const std::vector<Json> objects = lines();
  const Json process = {{"host", "host"}, {"program", "program"}, {"pid", 7}, {"tid", 70}};
  const auto with = [&process](Json rest) {
    rest.update(process);
    return rest;
  };

  ASSERT_EQ(objects.size(), 8U);
  EXPECT_THAT(exported("jsonl"), HasSubstr("\xef\xbf\xbd\xc3\xa9\"}\n"));  // not escaped
  EXPECT_EQ(objects[0], with({{"depth", 1},
                              {"function", "copyFile"},
                              {"time", kBegin + 1'005},
                              {"error", false},
                              {"text", kBadTextInUtf8}}));
  EXPECT_EQ(objects[2], with({{"depth", 1},
                              {"function", "checkFilePerms"},
                              {"begin", kBegin + 2'000},
                              {"end", kBegin + 5'007},
                              {"own", 3'007},
                              {"code", 32},
                              {"failed", true},
                              {"finished", true}}));
  EXPECT_EQ(objects[3]["code"], Json());
  EXPECT_EQ(objects[3]["failed"], Json());
  EXPECT_EQ(objects[4]["function"], "isDirectory");
  EXPECT_EQ(objects[4]["finished"], false);
  EXPECT_EQ(objects[6]["begin"], Json());
  EXPECT_EQ(objects[6]["own"], Json());
  EXPECT_EQ(objects[6]["failed"], false);

  const Result tree = osutils({"trace", "tree", "--json", temp.path("t")});
  const Json listed = Json::parse(tree.out);
  EXPECT_EQ(std::multiset<Json>(objects.begin(), objects.end()),
            std::multiset<Json>(listed.begin(), listed.end()));
}

TEST_F(TraceExport, RefusesOtherFormats) {
  makeCalls();
  expectFailure(osutils({"trace", "export", temp.path("t")}), HasSubstr("--format is missing"));
  for (const char* const wrong : {"", "Chrome", "json"}) {
    expectFailure(osutils({"trace", "export", "--format", wrong, temp.path("t")}),
                  HasSubstr("--format is not chrome, folded or jsonl"));
  }
  expectFailure(osutils({"trace", "export", "--json", "--format", "chrome", temp.path("t")}),
                HasSubstr("--json excludes --format"));
}

TEST_F(TraceExport, WhatCannotBeReadIsNamedOnceAndTheRestExported) {
  makeCalls();
  writeFile(temp.path("t/stream-1"), std::string(30, 'x'));
  const auto read = [&](const char* format) {
    return osutils({"trace", "export", "--format", format, temp.path("t")},
                   [this] { setenv("TMPDIR", temp.path().c_str(), 1); });
  };
  for (const char* const format : {"chrome", "folded", "jsonl"}) {
    const Result result = read(format);
    EXPECT_EQ(result.status, 3) << format;
    EXPECT_EQ(result.err,
              "osutils: trace export: " + temp.path("t") + ": cannot read the file stream-1\n");
    EXPECT_THAT(result.out, HasSubstr("copyFile")) << format;
  }
  EXPECT_TRUE(Json::accept(read("chrome").out));
}

TEST_F(TraceExport, AFullDiskIsAFailure) {
  makeCalls();
  for (const char* const format : {"chrome", "folded", "jsonl"}) {
    const Result result = osutils({"trace", "export", "--format", format, temp.path("t")}, [] {
      const int full = open("/dev/full", O_WRONLY);
      if (full == -1) _exit(126);
      dup2(full, STDOUT_FILENO);
    });
    EXPECT_EQ(result.status, 3) << format;
    EXPECT_THAT(result.err, HasSubstr("No space left on device")) << format;
  }
}

#ifndef SANITIZER_OWNS_MALLOC
// Of a child process that reads this many calls.
TEST_F(TraceExport, MemoryDoesNotGrowWithTheRecords) {
  const auto peak = [&](const char* format, uint64_t calls) {
    // Not in this process, because what it needs at the fork counts as its child's.
    EXPECT_EQ(inChild([&] {
                makeManyCalls(calls);
                return 0;
              }),
              0);
    const pid_t child = fork();
    if (child == 0) {
      const int null = open("/dev/null", O_WRONLY);
      dup2(null, STDOUT_FILENO);
      execl(OSUTILS_TOOL, OSUTILS_TOOL, "trace", "export", "--format", format,
            temp.path("t").c_str(), nullptr);
      _exit(126);
    }
    int status = -1;
    rusage usage = {};
    EXPECT_EQ(wait4(child, &status, 0, &usage), child);
    EXPECT_EQ(status, 0);
    return usage.ru_maxrss;  // KiB
  };
  for (const char* const format : {"chrome", "folded", "jsonl"}) {
    // Both files are larger than what libbabeltrace2 maps of one at a time. Its packets are not: 2.1 keeps some 60 bytes
    // for each event of a packet that it reads.
    const long few = peak(format, 100'000);
    EXPECT_LT(peak(format, 300'000), few + 8'192) << format;
  }
}
#endif

// A clock may be set back. All records are found again in the second reading.
TEST_F(TraceExport, TimesMayGoBack) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kBegin + 100, kCopyFile)
                                 .leave(kBegin + 300, kCopyFile, 1)
                                 .enter(kBegin + 250, kCopyFile)
                                 .leave(kBegin + 260, kCopyFile, 1)});
  EXPECT_EQ(eventsOfCalls().size(), 2U);
}

#ifndef SANITIZER_OWNS_MALLOC  // whose runtime must be the first library
// The trace is read twice for the format chrome.
TEST_F(TraceExport, CountsTheRecordsThatWereReplacedBetweenTheReadings) {
  const auto stream = [](uint64_t first, uint64_t last, uint64_t discarded) {
    MadeStream made(70);
    made.discard(discarded);
    for (uint64_t i = first; i <= last; ++i) {
      made.enter(kBegin + 10 * i, kCopyFile).leave(kBegin + 10 * i + 5, kCopyFile, 1);
    }
    return made;
  };
  struct Case {
    MadeStream second;
    std::string missing;
  };
  const Case cases[] = {
      {stream(2, 3, 2), "2 records"},  {stream(2, 9, 2), "2 records"},
      {stream(7, 8, 12), "4 records"}, {stream(1, 2, 5), ""},  // discarded afterwards
      {stream(1, 3, 0), ""},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.missing);
    makeTrace(temp.path("t"), {stream(1, 2, 0)});
    makeTrace(temp.path("second"), {one.second});
    const Result result =
        osutils({"trace", "export", "--format", "chrome", temp.path("t")}, [this] {
          setenv("LD_PRELOAD", SECOND_READING, 1);
          setenv("SECOND_READING",
                 ("LD_PRELOAD= ; cp '" + temp.path("second/stream-0") + "' '" +
                  temp.path("t/stream-0") + "'")
                     .c_str(),
                 1);
        });
    EXPECT_EQ(result.status, one.missing.empty() ? 0 : 3);
    EXPECT_EQ(result.err, one.missing.empty()
                              ? ""
                              : "osutils: trace export: " + one.missing +
                                    " missing that were there when the trace was read first\n");
  }
}
#endif

}  // namespace
