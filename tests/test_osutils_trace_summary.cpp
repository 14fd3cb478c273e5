// trace summary, on traces of the tests' own and of the library.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "made_trace.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using Json = nlohmann::json;

constexpr uint64_t kSecond = 1'000'000'000;
constexpr uint64_t kCopyFile = trace::functionId(6, 7);        // a success flag
constexpr uint64_t kCheckFilePerms = trace::functionId(6, 6);  // a code
constexpr uint64_t kIsDirectory = trace::functionId(6, 3);     // yes or no
constexpr uint64_t kFindPort = trace::functionId(1, 9);        // a number
constexpr uint64_t kGetTempDir = trace::functionId(3, 1);      // nothing
constexpr uint64_t kOwn = 0x12340000;                          // of a program

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
  EXPECT_EQ(answer["records"], 6);
  EXPECT_EQ(answer["traces"], 1);
}

}  // namespace
