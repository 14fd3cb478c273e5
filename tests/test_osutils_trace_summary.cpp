// trace summary, on traces of the tests' own and of the library.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
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

constexpr uint64_t kFindPort = trace::functionId(1, 9);  // a number

Json summary(Arguments options, const std::string& path, int status = 0) {
  options.insert(options.begin(), {"trace", "summary", "--json"});
  options.push_back(path);
  const Result result = osutils(options);
  EXPECT_EQ(result.status, status) << result.err;
  return Json::parse(result.out, nullptr, false);
}

Json rowOf(const Json& summary, const std::string& function) {
  for (const Json& row : summary["functions"]) {
    if (row["function"] == function) return row;
  }
  return Json::object();
}

TEST(TraceSummary, TimesTheCallsOfEachFunction) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(100, kCopyFile)
                                 .enter(110, kIsDirectory)
                                 .leave(140, kIsDirectory, 1)
                                 .enter(150, kIsDirectory)
                                 .leave(160, kIsDirectory, 0)
                                 .leave(200, kCopyFile, 1)});

  const Json answer = summary({}, temp.path("t"));

  EXPECT_EQ(answer["functions"].size(), 2U);
  EXPECT_EQ(rowOf(answer, "copyFile"), Json({{"function", "copyFile"},
                                             {"calls", 1},
                                             {"unfinished", 0},
                                             {"failures", Json::object()},
                                             {"unknown", 0},
                                             {"total", 100},
                                             {"own", 60},
                                             {"mean", 100},
                                             {"median", 100},
                                             {"p99", 100},
                                             {"longest", 100},
                                             {"longest_at", 100}}));
  EXPECT_EQ(rowOf(answer, "isDirectory"), Json({{"function", "isDirectory"},
                                                {"calls", 2},
                                                {"unfinished", 0},
                                                {"failures", Json::object()},
                                                {"unknown", 0},
                                                {"total", 40},
                                                {"own", 40},
                                                {"mean", 20},
                                                {"median", 10},
                                                {"p99", 30},
                                                {"longest", 30},
                                                {"longest_at", 110}}));
  Json rest = answer;
  rest.erase("functions");
  EXPECT_EQ(
      rest,
      Json({{"traces", 1}, {"records", 6}, {"discarded", 0}, {"foreign", 0}, {"unreadable", 0}}));
}

TEST(TraceSummary, TheTimesOfASingleCallAreExact) {
  for (const uint64_t time : {0U, 1U, 512U, 515U, 1023U, 12'345'678U}) {
    const TempDir temp;
    makeTrace(temp.path("t"),
              {MadeStream(70).enter(100, kCopyFile).leave(100 + time, kCopyFile, 1)});
    const Json row = rowOf(summary({}, temp.path("t")), "copyFile");
    for (const char* const key : {"total", "own", "mean", "median", "p99", "longest"}) {
      EXPECT_EQ(row[key], time) << key;
    }
  }
}

TEST(TraceSummary, KnowsFailuresByWhatTheCodeOfAFunctionSays) {
  const TempDir temp;
  MadeStream stream(70);
  uint64_t time = 100;
  const auto call = [&](uint64_t function, std::optional<int64_t> code) {
    stream.enter(time, function).leave(time + 1, function, code);
    time += 2;
  };
  for (const int64_t code : {0, 32, 32, 50}) call(kCheckFilePerms, code);
  for (const int64_t code : {0, 1, 1}) call(kCopyFile, code);
  for (const int64_t code : {0, 1}) call(kIsDirectory, code);
  for (const int64_t code : {3700, 0, -1}) call(kFindPort, code);
  call(kGetTempDir, 0);
  call(kOwn, 5);
  call(kCheckFilePerms, std::nullopt);
  makeTrace(temp.path("t"), {stream});

  const Json answer = summary({}, temp.path("t"));

  const auto failures = [&](const std::string& function) {
    return rowOf(answer, function)["failures"];
  };
  const auto unknown = [&](const std::string& function) {
    return rowOf(answer, function)["unknown"];
  };
  EXPECT_EQ(failures("checkFilePerms"), Json({{"32", 2}, {"50", 1}}));
  EXPECT_EQ(unknown("checkFilePerms"), 1);
  EXPECT_EQ(failures("copyFile"), Json({{"0", 1}}));
  EXPECT_EQ(failures("isDirectory"), Json::object());
  EXPECT_EQ(failures("EtcServices::findAvaliablePort"), Json({{"-1", 1}}));
  for (const char* const known : {"copyFile", "isDirectory", "EtcServices::findAvaliablePort"}) {
    EXPECT_EQ(unknown(known), 0) << known;
  }
  for (const char* const other : {"getTempDir", "0x12340000"}) {
    EXPECT_EQ(failures(other), Json::object()) << other;
    EXPECT_EQ(unknown(other), 1) << other;
  }
}

TEST(TraceSummary, CountsUnfinishedCallsAndExitsWithoutAnEntry) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .leave(90, kIsDirectory, 1)
                                 .enter(100, kCopyFile)
                                 .enter(110, kIsDirectory)  // its exit is missing
                                 .leave(200, kCopyFile, 1)
                                 .enter(210, kCopyFile)});

  const Json answer = summary({}, temp.path("t"));

  const Json directory = rowOf(answer, "isDirectory");
  EXPECT_EQ(directory["calls"], 2);
  EXPECT_EQ(directory["unfinished"], 1);
  EXPECT_EQ(directory["total"], 0);
  EXPECT_TRUE(directory["mean"].is_null());
  EXPECT_TRUE(directory["longest_at"].is_null());
  const Json copy = rowOf(answer, "copyFile");
  EXPECT_EQ(copy["calls"], 2);
  EXPECT_EQ(copy["unfinished"], 1);
  EXPECT_EQ(copy["total"], 100);
  EXPECT_EQ(copy["own"], 10);
}

TEST(TraceSummary, HasPercentilesWithinAHundredth) {
  const TempDir temp;
  MadeStream stream(70);
  std::vector<uint64_t> times;
  uint64_t now = 1;
  uint64_t random = 1;
  for (int i = 0; i < 5000; ++i) {
    random = random * 6364136223846793005U + 1442695040888963407U;
    times.push_back((random >> 33) >> (random % 20));
    stream.enter(now, kIsDirectory).leave(now + times.back(), kIsDirectory, 1);
    now += times.back() + 1;
  }
  makeTrace(temp.path("t"), {stream});
  std::sort(times.begin(), times.end());

  const Json row = rowOf(summary({}, temp.path("t")), "isDirectory");

  const auto isNear = [](const Json& found, uint64_t exact) {
    return std::abs(found.get<double>() - static_cast<double>(exact)) <=
           static_cast<double>(exact) / 100;
  };
  EXPECT_TRUE(isNear(row["median"], times[2499])) << row["median"] << " not " << times[2499];
  EXPECT_TRUE(isNear(row["p99"], times[4949])) << row["p99"] << " not " << times[4949];
  EXPECT_EQ(row["longest"], times.back());
}

TEST(TraceSummary, MergesTracesAndTellsThreadsAndProcessesApart) {
  const TempDir temp;
  const MadeStream first = MadeStream(70).enter(100, kIsDirectory).leave(150, kIsDirectory, 1);
  const MadeStream second = MadeStream(71).enter(100, kIsDirectory).leave(110, kIsDirectory, 1);
  makeTrace(temp.path("a/one"), {first, second});
  std::string other = kMadeMetadata;
  other.replace(other.find("vpid = 7"), 8, "vpid = 8");
  makeTrace(temp.path("b"), {first}, other);

  const Json functions = summary({temp.path("a")}, temp.path("b"));
  const Json threads = summary({"--by", "thread", temp.path("a")}, temp.path("b"));
  const Json processes = summary({"--by", "process", temp.path("a")}, temp.path("b"));

  EXPECT_EQ(functions["traces"], 2);
  EXPECT_EQ(rowOf(functions, "isDirectory")["calls"], 3);
  ASSERT_EQ(threads["threads"].size(), 3U);
  EXPECT_EQ(threads["threads"][2]["tid"], 71);
  ASSERT_EQ(processes["processes"].size(), 2U);
  EXPECT_EQ(processes["processes"][0]["pid"], 7);
  EXPECT_EQ(processes["processes"][0]["host"], "host");
  EXPECT_EQ(processes["processes"][0]["program"], "program");
  EXPECT_EQ(processes["processes"][0]["calls"], 2);
}

TEST(TraceSummary, TakesARangeOfTime) {
  const TempDir temp;
  MadeStream stream(70);
  for (uint64_t second = 1; second <= 5; ++second) {
    stream.enter(second * kSecond, kIsDirectory).leave(second * kSecond + 10, kIsDirectory, 1);
  }
  makeTrace(temp.path("t"), {stream});
  const auto calls = [&](const Arguments& options) {
    return rowOf(summary(options, temp.path("t")), "isDirectory")["calls"];
  };

  EXPECT_EQ(calls({"--from", "1970-01-01T00:00:02Z"}), 4);
  EXPECT_EQ(calls({"--from", "1970-01-01T00:00:02.000000001"}), 3);
  EXPECT_EQ(calls({"--to", "1970-01-01T00:00:02"}), 1);
  EXPECT_EQ(calls({"--from=1970-01-01T00:00:02", "--to=1970-01-01T00:00:04.0Z"}), 2);
  for (const char* const wrong :
       {"", "now", "1970-01-01", "1970-02-30T00:00:00", "1970-01-01T24:00:00",
        "1970-01-01T00:00:02.", "1970-01-01T00:00:02.1234567890", "1970-01-01T00:00:02+01:00",
        "9999-01-01T00:00:00"}) {
    EXPECT_EQ(osutils({"trace", "summary", "--from", wrong, temp.path("t")}).status, 2) << wrong;
  }
}

TEST(TraceSummary, ARangeHasATimeInIt) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70).enter(kSecond, kIsDirectory)});
  for (const char* const to : {"1970-01-01T00:00:01", "1970-01-01T00:00:00.9"}) {
    expectFailure(
        osutils({"trace", "summary", "--from", "1970-01-01T00:00:01", "--to", to, temp.path("t")}),
        "osutils: trace summary: parameter error (89): --from is not before --to\n");
  }
}

TEST(TraceSummary, ARangeLeavesOutWhatACallDidAfterItButNotFromTheCallsOwnTime) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kSecond, kCopyFile)
                                 .enter(3 * kSecond, kIsDirectory)
                                 .leave(4 * kSecond, kIsDirectory, 1)
                                 .leave(6 * kSecond, kCopyFile, 1)});
  const Json answer = summary({"--to", "1970-01-01T00:00:02"}, temp.path("t"));
  ASSERT_EQ(answer["functions"].size(), 1U);
  EXPECT_EQ(rowOf(answer, "copyFile")["total"], 5 * kSecond);
  EXPECT_EQ(rowOf(answer, "copyFile")["own"], 4 * kSecond);
}

TEST(TraceSummary, CountsAFolderOnceWhateverNamesLeadToIt) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  std::filesystem::create_directory_symlink(temp.path("t"), temp.path("link"));
  const Result result = osutils({"trace", "summary", "--json", temp.path("t"), temp.path("./t"),
                                 temp.path("link"), temp.path()});
  EXPECT_EQ(result.err, "");
  const Json answer = Json::parse(result.out);
  EXPECT_EQ(rowOf(answer, "copyFile")["calls"], 1);
  EXPECT_EQ(answer["traces"], 1);
}

TEST(TraceSummary, TakesNamesFromAFile) {
  const TempDir temp;
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(100, kOwn).leave(200, kOwn, 1).enter(300, 77).leave(301, 77, 0)});
  temp.file("names", "# of the server\n\n0x12340000 migrate users\r\n  77\tstop \n");

  const Json answer = summary({"--names", temp.path("names")}, temp.path("t"));

  EXPECT_EQ(rowOf(answer, "migrate users")["calls"], 1);
  EXPECT_EQ(rowOf(answer, "stop")["calls"], 1);
  const std::vector<std::pair<std::string, std::string>> wrong = {
      {"1 a\nx b\n", "line 2 of @ does not begin with a number"},
      {"0x b\n", "line 1 of @ does not begin with a number"},
      {"99999999999999999999 b\n", "line 1 of @ does not begin with a number"},
      {"5\n", "line 1 of @ has no name"},
      {"5 a\n0x5 b\n", "line 2 of @ names a number again"}};
  for (const auto& [contents, line] : wrong) {
    const std::string path = temp.file("wrong", contents);
    std::string expected = line;
    expected.replace(expected.find('@'), 1, path);
    const Result result = osutils({"trace", "summary", "--names", path, temp.path("t")});
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(result.err, "osutils: trace summary: constraint violation (19): " + expected + "\n");
  }
  EXPECT_EQ(osutils({"trace", "summary", "--names", temp.path("no"), temp.path("t")}).status, 3);
}

TEST(TraceSummary, SortsAndSelects) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(100, kCopyFile)
                                 .leave(110, kCopyFile, 0)
                                 .enter(200, kIsDirectory)
                                 .leave(240, kIsDirectory, 1)
                                 .enter(300, kIsDirectory)
                                 .leave(302, kIsDirectory, 1)});
  const auto first = [&](const std::string& key) {
    return summary({"--sort", key}, temp.path("t"))["functions"][0]["function"];
  };

  EXPECT_EQ(summary({}, temp.path("t"))["functions"][0]["function"], "isDirectory");
  for (const char* const key : {"total", "own", "mean", "p99", "longest", "calls"}) {
    EXPECT_EQ(first(key), "isDirectory") << key;
  }
  for (const char* const key : {"median", "failures", "function"}) {
    EXPECT_EQ(first(key), "copyFile") << key;
  }
  const Json failed = summary({"--errors"}, temp.path("t"));
  ASSERT_EQ(failed["functions"].size(), 1U);
  EXPECT_EQ(failed["functions"][0]["function"], "copyFile");
  EXPECT_EQ(osutils({"trace", "summary", "--sort", "size", temp.path("t")}).status, 2);
  EXPECT_EQ(osutils({"trace", "summary", "--by", "host", temp.path("t")}).status, 2);
  EXPECT_EQ(
      osutils({"trace", "summary", "--by", "thread", "--sort", "function", temp.path("t")}).status,
      2);
}

TEST(TraceSummary, PrintsATable) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(1'500'000'000, kCheckFilePerms)
                                 .leave(1'512'345'678, kCheckFilePerms, 32)});

  const Result result = osutils({"trace", "summary", temp.path("t")});

  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(result.out,
            "FUNCTION        CALLS  UNFINISHED  UNKNOWN  FAILURES  TOTAL   OWN     MEAN    MEDIAN  "
            "P99     LONGEST  LONGEST_AT\n"
            "checkFilePerms  1      0           0        32:1      12.3ms  12.3ms  12.3ms  12.3ms  "
            "12.3ms  12.3ms   1970-01-01T00:00:01.500000000Z\n");
  EXPECT_EQ(result.err, "");
}

TEST(TraceSummary, SaysHowManyRecordsAreMissing) {
  const TempDir temp;
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(100, kCopyFile).discard(5).leave(200, kCopyFile, 1)});

  const Result result = osutils({"trace", "summary", "--json", temp.path("t")});

  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "osutils: trace summary: 5 records missing: the tracer discarded them\n");
  EXPECT_EQ(Json::parse(result.out)["discarded"], 5);
}

// As LTTng writes them: a stream for each processor, and the thread in the context of each event.
TEST(TraceSummary, FollowsAThreadThroughTheStreamsOfSeveralProcessors) {
  const TempDir temp;
  std::string metadata = kMadeMetadata;
  metadata.erase(metadata.find("    number64 events_discarded; number64 tid;"), 44);
  metadata.replace(metadata.find("event.header"), 0,
                   "event.context := struct { number32 vpid; number32 vtid;\n"
                   "    integer { size = 8; align = 8; encoding = UTF8; } procname[4]; };\n  ");
  std::filesystem::create_directories(temp.path("t"));
  writeFile(temp.path("t/metadata"), metadata);
  const auto add = [](std::string& bytes, auto number) {
    bytes.append(reinterpret_cast<const char*>(&number), sizeof number);
  };
  const auto stream = [&](uint64_t instance, const std::vector<std::vector<uint64_t>>& events) {
    std::string contents;
    for (const std::vector<uint64_t>& event : events) {  // time, process, thread, type, code
      const bool is_exit = event[3] == trace::kExit33;
      add(contents, static_cast<uint32_t>(is_exit ? 1 : 0));
      add(contents, event[0]);
      add(contents, static_cast<uint32_t>(event[1]));
      add(contents, static_cast<uint32_t>(event[2]));
      contents.append("prog", 4);
      for (const uint64_t field : {event[3], kCheckFilePerms, uint64_t{0}}) add(contents, field);
      if (is_exit) add(contents, event[4]);
    }
    std::string bytes;
    add(bytes, uint32_t{0xC1FC1FC1});
    add(bytes, uint32_t{0});
    add(bytes, instance);
    const uint64_t bits = (bytes.size() + 4 * sizeof(uint64_t) + contents.size()) * 8;
    for (const uint64_t field : {bits, bits, events.front()[0], events.back()[0]})
      add(bytes, field);
    writeFile(temp.path("t/osutils_" + std::to_string(instance)), bytes + contents);
  };
  stream(0, {{100, 5, 50, trace::kEntry33},
             {150, 6, 60, trace::kEntry33},
             {400, 6, 60, trace::kExit33, 32}});
  stream(1, {{120, 5, 51, trace::kEntry33},
             {200, 5, 50, trace::kExit33, 0},
             {300, 5, 51, trace::kExit33, 0}});

  const Json threads = summary({"--by", "thread"}, temp.path("t"));

  ASSERT_EQ(threads["threads"].size(), 3U);
  const std::vector<std::vector<int>> expected = {{6, 60, 250}, {5, 51, 180}, {5, 50, 100}};
  for (size_t i = 0; i < expected.size(); ++i) {
    const Json& row = threads["threads"][i];
    EXPECT_EQ((std::vector<int>{row["pid"], row["tid"], row["total"]}), expected[i]);
    EXPECT_EQ(row["program"], "prog");
    EXPECT_EQ(row["host"], "host");
  }
  EXPECT_EQ(threads["threads"][0]["failures"], Json({{"32", 1}}));
  EXPECT_EQ(threads["records"], 6);
}

// One kind says the thread in its packets, the other in its events.
TEST(TraceSummary, CountsTheStreamsOfTwoKindsOnce) {
  const TempDir temp;
  std::string other = kMadeMetadata;
  other.erase(0, other.find("stream {\n"));
  for (const char* const id : {"stream {\n  id = 0", "stream_id = 0"}) {
    for (size_t at = 0; (at = other.find(id, at)) != std::string::npos; ++at) {
      other[at + strlen(id) - 1] = '1';
    }
  }
  other.erase(other.find(" number64 tid;"), 14);
  other.replace(other.find("event.header"), 0, "event.context := struct { number64 vtid; };\n  ");
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kIsDirectory).leave(150, kIsDirectory, 1)},
            kMadeMetadata + other);
  std::string bytes;
  const auto add = [&bytes](auto number) {
    bytes.append(reinterpret_cast<const char*>(&number), sizeof number);
  };
  add(uint32_t{0xC1FC1FC1});
  add(uint32_t{1});
  constexpr uint64_t kBits = 8 * (16 + 5 * 8 + 2 * 44);
  for (const uint64_t number :
       {uint64_t{1}, kBits, kBits, uint64_t{110}, uint64_t{140}, uint64_t{0}})
    add(number);
  for (const auto& [time, type] :
       {std::pair(110, trace::kEntry33), std::pair(140, trace::kExit33)}) {
    add(uint32_t{0});
    for (const uint64_t number :
         {static_cast<uint64_t>(time), uint64_t{71}, type, kCopyFile, uint64_t{0}})
      add(number);
  }
  writeFile(temp.path("t/other"), bytes);

  const Json threads = summary({"--by", "thread"}, temp.path("t"));

  ASSERT_EQ(threads["threads"].size(), 2U);
  for (const size_t i : {0U, 1U}) {
    EXPECT_EQ(threads["threads"][i]["calls"], 1);
    EXPECT_EQ(threads["threads"][i]["tid"], 70 + i);
    EXPECT_EQ(threads["threads"][i]["total"], i == 0 ? 50 : 30);
  }
  EXPECT_EQ(threads["records"], 4);
}

// ---- What cannot be read ----

// libbabeltrace2's parser leaks what it had parsed when it finds an error.
#ifdef SANITIZER_OWNS_MALLOC
constexpr bool kChangesMetadata = false;
#else
constexpr bool kChangesMetadata = true;
#endif

class BadTrace : public ::testing::Test {
 protected:
  // A trace of three threads, of which `change` makes one or all bad.
  Result read(
      const std::function<void(const std::string& path)>& change,
      const std::function<void()>& limit = [] {}) {
    std::filesystem::remove_all(temp.path("t"));
    std::vector<MadeStream> streams;
    for (uint64_t thread = 70; thread < 73; ++thread) {
      streams.push_back(MadeStream(thread).enter(100, kCopyFile).leave(200, kCopyFile, 1));
    }
    makeTrace(temp.path("t"), streams);
    change(temp.path("t"));
    const Result result = osutils({"trace", "summary", "--json", temp.path("t")}, [&] {
      limit();
      setenv("TMPDIR", temp.path().c_str(), 1);
    });
    answer = Json::parse(result.out, nullptr, false);
    return result;
  }
  void expectCalls(int calls) {
    ASSERT_TRUE(answer.is_object());
    EXPECT_EQ(rowOf(answer, "copyFile")["calls"], calls);
  }

  const TempDir temp;
  Json answer;
};

TEST_F(BadTrace, AFolderWithoutATraceIsNamed) {
  const Result result = osutils({"trace", "summary", temp.dir("empty")});
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err, "osutils: trace summary: " + temp.path("empty") +
                            ": there is no trace here or below\n");
  EXPECT_EQ(osutils({"trace", "summary", temp.path("no")}).err,
            "osutils: trace summary: " + temp.path("no") + ": No such file or directory\n");
}

TEST_F(BadTrace, OnlyAFileThatIsCutIsLeftOut) {
  for (const uintmax_t size : {10U, 60U, 100U, 150U}) {
    SCOPED_TRACE(size);
    const Result result = read(
        [&](const std::string& path) { std::filesystem::resize_file(path + "/stream-1", size); });
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(result.err,
              "osutils: trace summary: " + temp.path("t") + ": cannot read the file stream-1\n");
    expectCalls(2);
    EXPECT_EQ(answer["unreadable"], 1);
  }
  for (const auto& entry : std::filesystem::directory_iterator(temp.path())) {
    EXPECT_EQ(entry.path().filename(), "t");  // nothing temporary stays
  }
}

TEST_F(BadTrace, RecordsBeforeABadOneAreRead) {
  const Result result = read([](const std::string& path) {
    std::string bytes = contentsOf(path + "/stream-1");
    bytes.replace(bytes.size() - 44, 4, "\xff\xff\xff\xff");  // the number of the exit's event
    writeFile(path + "/stream-1", bytes);
  });
  EXPECT_EQ(result.status, 3);
  EXPECT_THAT(result.err, HasSubstr(temp.path("t")));
  expectCalls(3);
  EXPECT_EQ(rowOf(answer, "copyFile")["unfinished"], 1);
  EXPECT_EQ(answer["unreadable"], 1);
}

TEST_F(BadTrace, ARecordThatTheEndOfThePacketCutsIsReported) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "libbabeltrace2 leaks what it has read of the record";
#endif
  const Result result = read([](const std::string& path) {
    std::string bytes = MadeStream(71)
                            .enter(100, kCopyFile)
                            .leave(110, kCopyFile, 1)
                            .message(120, kCopyFile, "text")
                            .file();
    bytes[bytes.size() - 8] = 5;  // the length of the text
    writeFile(path + "/stream-1", bytes);
  });
  EXPECT_EQ(result.status, 3);
  EXPECT_THAT(result.err, HasSubstr(temp.path("t")));
  expectCalls(3);
  EXPECT_EQ(answer["unreadable"], 1);
}

TEST_F(BadTrace, MetadataThatIsCutIsNamed) {
  std::vector<uintmax_t> sizes = {0, 100};
  if (kChangesMetadata) sizes.push_back(1000);
  for (const uintmax_t size : sizes) {
    const Result result = read(
        [&](const std::string& path) { std::filesystem::resize_file(path + "/metadata", size); });
    EXPECT_EQ(result.status, 3) << size;
    EXPECT_THAT(result.err, HasSubstr(temp.path("t"))) << size;
    EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
    EXPECT_EQ(answer["records"], 0);
    EXPECT_EQ(answer["unreadable"], 1);
  }
}

TEST_F(BadTrace, WithoutMetadataToReadOnlyThatFolderIsLeftOut) {
  for (const uintmax_t size : {0U, 1U, 3U}) {
    const Result result = read([&](const std::string& path) {
      makeTrace(path + "/other", {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
      std::filesystem::resize_file(path + "/metadata", size);
    });
    EXPECT_EQ(result.status, 3) << size;
    EXPECT_EQ(result.err,
              "osutils: trace summary: " + temp.path("t") + ": cannot read the file metadata\n")
        << size;
    expectCalls(1);
    EXPECT_EQ(answer["unreadable"], 1);
  }
}

// libbabeltrace2 looks for the next packet without an end.
TEST_F(BadTrace, APacketWithoutASizeEndsTheReading) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "the limit of memory is off with a sanitizer";
#endif
  const Result result = read([](const std::string& path) {
    std::string bytes = contentsOf(path + "/stream-1");
    bytes.replace(16, 16, std::string(16, '\0'));
    writeFile(path + "/stream-1", bytes);
  });
  EXPECT_EQ(result.status, 3);
  EXPECT_THAT(result.err, ::testing::EndsWith("osutils: trace: libbabeltrace2 fails over " +
                                              temp.path("t") + "\n"));
  rusage used;
  ASSERT_EQ(getrusage(RUSAGE_CHILDREN, &used), 0);
  EXPECT_LT(used.ru_maxrss, 1'500'000) << "KiB";
}

// The handler of the crash has a stack of its own.
TEST_F(BadTrace, MetadataThatOverflowTheStackAreNamed) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer handles the signal";
#endif
  const Result result = read(
      [](const std::string& path) {
        std::string nested = "typealias ";
        for (int i = 0; i < 2000; ++i) nested += "struct { ";
        nested += "integer { size = 8; } x; ";
        for (int i = 1; i < 2000; ++i) nested += "} y; ";
        std::ofstream(path + "/metadata", std::ios::app) << nested << "} := nested;\n";
      },
      [] {
        rlimit limit;
        getrlimit(RLIMIT_STACK, &limit);
        limit.rlim_cur = rlim_t{256} * 1024;
        setrlimit(RLIMIT_STACK, &limit);
      });
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err, "osutils: trace: libbabeltrace2 fails over " + temp.path("t") + "\n");
}

// The order of the folder's entries decides whether libbabeltrace2 comes upon a file that is cut before that one.
TEST_F(BadTrace, AFolderThatLibbabeltrace2FailsOverIsLeftOutBesideOthers) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "the limit of memory is off with a sanitizer";
#endif
  for (const char* const cut : {"", "/stream-0", "/stream-2"}) {
    SCOPED_TRACE(cut);
    const Result result = read(
        [cut](const std::string& path) {
          for (const char* const folder : {"/a", "/c"}) {
            makeTrace(path + folder,
                      {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
          }
          std::string bytes = contentsOf(path + "/stream-1");
          bytes.replace(16, 16, std::string(16, '\0'));
          writeFile(path + "/stream-1", bytes);
          if (*cut != '\0') std::filesystem::resize_file(path + cut, 100);
          std::filesystem::create_directory(path + "/b");
          for (const char* const file : {"/metadata", "/stream-0", "/stream-1", "/stream-2"}) {
            std::filesystem::rename(path + file, path + "/b" + file);
          }
        },
        [] {
          const rlimit little = {rlim_t{100} << 20, RLIM_INFINITY};
          (void)setrlimit(RLIMIT_AS, &little);
        });
    EXPECT_EQ(result.status, 3);
    EXPECT_THAT(result.err, ::testing::EndsWith("osutils: trace summary: " + temp.path("t/b") +
                                                ": libbabeltrace2 fails over this folder\n"));
    expectCalls(2);
    EXPECT_EQ(answer["unreadable"], 1);
    std::filesystem::remove_all(temp.path("t"));
  }
}

// The tree waits for the reader of its output while it reads the part of the folder that can be read.
TEST_F(BadTrace, ASignalThatEndsTheReadingLeavesNothingTemporary) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer owns SIGABRT";
#endif
  (void)read([](const std::string& path) {
    MadeStream stream(70);
    for (uint64_t i = 1; i <= 20'000; ++i) stream.enter(i, kCopyFile).leave(i, kCopyFile, 1);
    writeFile(path + "/stream-0", stream.file());
    std::filesystem::resize_file(path + "/stream-1", 100);
  });
  const auto temporary = [&] {
    int folders = 0;
    for (const auto& entry : std::filesystem::directory_iterator(temp.path())) {
      folders += entry.path().filename().string().starts_with("osutils-trace-") ? 1 : 0;
    }
    return folders;
  };
  struct Case {
    int signal;
    bool is_ignored;
    int status;  // as waitpid sets it
  };
  const Case cases[] = {{SIGHUP, false, SIGHUP},   {SIGINT, false, SIGINT},
                        {SIGQUIT, false, SIGQUIT}, {SIGTERM, false, SIGTERM},
                        {SIGALRM, false, SIGALRM}, {SIGXCPU, false, SIGXCPU},
                        {SIGUSR1, false, SIGUSR1}, {SIGUSR2, false, SIGUSR2},
                        {SIGABRT, false, 3 << 8},  // as over a bad trace
                        {SIGHUP, true, 3 << 8}};   // read to the end
  for (const Case& one : cases) {
    SCOPED_TRACE(one.signal);
    int out[2];
    ASSERT_EQ(pipe2(out, O_CLOEXEC), 0);
    const std::string path = temp.path("t");
    const pid_t child = fork();
    if (child == 0) {
      // A shell's background job, and a test in it, ignores two of them.
      (void)signal(one.signal, one.is_ignored ? SIG_IGN : SIG_DFL);
      const rlimit none = {0, 0};
      (void)setrlimit(RLIMIT_CORE, &none);
      setenv("TMPDIR", temp.path().c_str(), 1);
      dup2(out[1], STDOUT_FILENO);
      dup2(open("/dev/null", O_WRONLY | O_CLOEXEC), STDERR_FILENO);
      execl(OSUTILS_TOOL, OSUTILS_TOOL, "trace", "tree", path.c_str(), nullptr);
      _exit(126);
    }
    close(out[1]);
    char first = 0;
    EXPECT_EQ(::read(out[0], &first, 1), 1);
    EXPECT_EQ(temporary(), 1);
    EXPECT_EQ(kill(child, one.signal), 0);
    const std::string text = readAll(out[0]);
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n') == 20'000 + 1 + 2, one.is_ignored);
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    // Without the bit of a dump, which a program may receive in spite of the limit.
    EXPECT_EQ(status & ~WCOREFLAG, one.status);
    EXPECT_EQ(temporary(), 0);
  }
}

TEST_F(BadTrace, EventsWithoutContentsEnd) {
  const Result result = read([](const std::string& path) {
    std::string metadata = kMadeMetadata;
    metadata.replace(metadata.find("event.header"),
                     metadata.find("};\n};\nevent") - metadata.find("event.header"),
                     "event.header := struct { ");
    metadata.erase(metadata.find("event {\n  name = \"record\""));
    writeFile(path + "/metadata",
              metadata + "event { name = \"e\"; id = 0; stream_id = 0; fields := struct { }; };\n");
  });
  EXPECT_EQ(result.status, 3);
  EXPECT_THAT(result.err, ::testing::AnyOf(HasSubstr(": events without contents, without an end\n"),
                                           HasSubstr("Invalid empty event record")));  // since 2.1
}

TEST_F(BadTrace, AnyChangedByteEndsWithAnAnswerOrAMessage) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "libbabeltrace2 aborts over some, which a sanitizer reports";
#endif
  uint64_t random = 1;
  for (int change = 0; change < 60; ++change) {
    SCOPED_TRACE(change);
    const Result result = read([&](const std::string& path) {
      random = random * 6364136223846793005U + 1442695040888963407U;
      const std::string file =
          path + ((random >> 62) == 0 && kChangesMetadata ? "/metadata" : "/stream-1");
      std::string bytes = contentsOf(file);
      bytes[(random >> 20) % bytes.size()] = static_cast<char>(random >> 50);
      writeFile(file, bytes);
    });
    EXPECT_TRUE(result.status == 0 || result.status == 3) << result.status;
    EXPECT_TRUE(result.status == 3 || answer.is_object()) << result.out;
    EXPECT_TRUE(result.status == 0 || result.err.find("osutils: trace") != std::string::npos)
        << result.err;
  }
}

TEST_F(BadTrace, AnotherProgramsEventsAreCounted) {
  Result result = read([](const std::string& path) {
    writeFile(path + "/stream-1", MadeStream(71).other(100).other(110).file());
  });
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "osutils: trace summary: 2 events not of traced functions left out\n");
  expectCalls(2);

  result = read([](const std::string& path) {
    for (uint64_t i = 0; i < 3; ++i) {
      writeFile(path + "/stream-" + std::to_string(i), MadeStream(70 + i).other(100).file());
    }
  });
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err,
            "osutils: trace summary: 3 events not of traced functions left out: no others\n");
}

TEST_F(BadTrace, ATimeThatIsTooLargeDoesNotEndTheReading) {
  const Result result = read([](const std::string& path) {
    makeTrace(path + "/a", {MadeStream(70)
                                .enter(100, kCopyFile)
                                .enter(UINT64_MAX, kCopyFile)
                                .leave(200, kCopyFile, 1)});
    makeTrace(path + "/b", {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  });
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "osutils: trace summary: 1 event not of traced functions left out\n");
  expectCalls(5);
}

TEST_F(BadTrace, ManyThreadsAreRead) {
  const Result result = read([](const std::string& path) {
    for (uint64_t thread = 3; thread < 5000; ++thread) {
      writeFile(path + "/stream-" + std::to_string(thread),
                MadeStream(thread + 70).enter(100, kCopyFile).leave(200, kCopyFile, 1).file());
    }
  });
  EXPECT_EQ(result.status, 0) << result.err;
  expectCalls(5000);
}

TEST_F(BadTrace, ControlCharactersStayOutOfTheTable) {
  (void)read([](const std::string&) {});
  temp.file("names", "0x12340000 a\x1b[2Jb\n");
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kOwn).leave(200, kOwn, 1)});
  const Result result =
      osutils({"trace", "summary", "--names", temp.path("names"), temp.path("t")});
  EXPECT_THAT(result.out, HasSubstr("a?[2Jb"));
}

}  // namespace
