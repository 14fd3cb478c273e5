// trace tree, on traces of the tests' own and of the library.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "made_trace.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;
using ::testing::Not;
using Json = nlohmann::json;

class TraceTree : public ::testing::Test {
 protected:
  Result tree(Arguments options) {
    options.insert(options.begin(), {"trace", "tree"});
    options.push_back(temp.path("t"));
    const Result result = osutils(options);
    EXPECT_EQ(result.status, 0) << result.err;
    return result;
  }
  void makeCalls() {
    makeTrace(temp.path("t"),
              {MadeStream(70)
                   .message(50, trace::kOrdinaryLevel, "outside\n")
                   .enter(100, kCopyFile)
                   .message(105, kCopyFile + 1, "copyFile: \x1b[31m</script>\n")
                   .enter(110, kIsDirectory)
                   .leave(140, kIsDirectory, 0)
                   .enter(150, kCheckFilePerms)
                   .message(155, kCheckFilePerms + 0x11, "no", trace::kDebugError)
                   .leave(160, kCheckFilePerms, 32)
                   .leave(3'000'200, kCopyFile, 1)
                   .leave(3'000'300, kIsDirectory, 1)
                   .enter(3'000'400, kGetTempDir)
                   .leave(3'000'500, kGetTempDir, 0)
                   .enter(3'000'600, kCopyFile),
               MadeStream(71).enter(120, kIsDirectory).leave(121, kIsDirectory, 1)});
  }

  const TempDir temp;
};

TEST_F(TraceTree, ShowsCallsAndMessagesOfEachThread) {
  makeCalls();
  EXPECT_EQ(tree({}).out,
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000050  - outside\n"
            "00:00:00.000000100  copyFile  3.00ms  = 1\n"
            "00:00:00.000000105    - copyFile: ?[31m</script>\n"
            "00:00:00.000000110    isDirectory  30ns  = 0\n"
            "00:00:00.000000150    checkFilePerms  10ns  = 32  FAILED\n"
            "00:00:00.000000155      ! no\n"
            "00:00:00.003000300  isDirectory  = 1  WITHOUT ENTRY\n"
            "00:00:00.003000400  getTempDir  100ns\n"
            "00:00:00.003000600  copyFile  0ns  UNFINISHED\n"
            "host program process 7 thread 71 1970-01-01\n"
            "00:00:00.000000120  isDirectory  1ns  = 1\n");
}

#ifndef SANITIZER_OWNS_MALLOC
TEST_F(TraceTree, NeedsNoMemoryForThreadsThatHaveEnded) {
  const auto peak = [&](uint64_t threads) {
    std::vector<MadeStream> streams;
    for (uint64_t thread = 0; thread < threads; ++thread) {
      MadeStream stream(70 + thread);
      stream.enter(100, kCopyFile);
      for (int i = 0; i < 10'000; ++i) stream.message(110, kCopyFile, "text");
      streams.push_back(stream.leave(200, kCopyFile, 1));
    }
    makeTrace(temp.path("t"), streams);
    const std::string path = temp.path("t");
    const pid_t child = fork();
    if (child == 0) {
      dup2(open("/dev/null", O_WRONLY | O_CLOEXEC), STDOUT_FILENO);
      execl(OSUTILS_TOOL, OSUTILS_TOOL, "trace", "tree", path.c_str(), nullptr);
      _exit(126);
    }
    int status = -1;
    rusage usage = {};
    EXPECT_EQ(wait4(child, &status, 0, &usage), child);
    EXPECT_EQ(status, 0);
    return usage.ru_maxrss;  // KiB
  };
  const long few = peak(2);
  EXPECT_LT(peak(22), few + 8'192);
}
#endif

TEST_F(TraceTree, ShowsOnlyFailedCallsInTheCallsAroundThem) {
  makeCalls();
  EXPECT_EQ(tree({"--only-failed"}).out,
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000100  copyFile  3.00ms  = 1\n"
            "00:00:00.000000105    - copyFile: ?[31m</script>\n"
            "00:00:00.000000150    checkFilePerms  10ns  = 32  FAILED\n"
            "00:00:00.000000155      ! no\n");
}

TEST_F(TraceTree, ShowsOnlySlowCalls) {
  makeCalls();
  EXPECT_EQ(tree({"--min-time", "0.03us"}).out,
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000100  copyFile  3.00ms  = 1\n"
            "00:00:00.000000105    - copyFile: ?[31m</script>\n"
            "00:00:00.000000110    isDirectory  30ns  = 0\n"
            "00:00:00.003000400  getTempDir  100ns\n");
  EXPECT_EQ(tree({"--min-time", "3.01ms"}).out, "");
  EXPECT_THAT(tree({"--min-time", "1ns"}).out,
              AllOf(HasSubstr("isDirectory  1ns"), Not(HasSubstr("outside"))));
  EXPECT_THAT(tree({"--min-time", "0ns"}).out, HasSubstr("outside"));
  for (const char* const wrong : {"", "1", "ms", "1m", "-1ms", "1.ms", "1 ms", "9999999999s"}) {
    EXPECT_EQ(osutils({"trace", "tree", "--min-time", wrong, temp.path("t")}).status, 2) << wrong;
  }
}

TEST_F(TraceTree, ShowsOnlyAFunctionAndWhatItCalls) {
  makeCalls();
  EXPECT_EQ(tree({"--function", "checkFilePerms"}).out,
            "host program process 7 thread 70 1970-01-01\n"
            "00:00:00.000000100  copyFile  3.00ms  = 1\n"
            "00:00:00.000000105    - copyFile: ?[31m</script>\n"
            "00:00:00.000000150    checkFilePerms  10ns  = 32  FAILED\n"
            "00:00:00.000000155      ! no\n");
  EXPECT_THAT(tree({"--function", "copyFile", "--only-failed"}).out, HasSubstr("checkFilePerms"));
  EXPECT_EQ(tree({"--function", "copy"}).out, "");
}

TEST_F(TraceTree, IsAListOfObjectsInJson) {
  makeCalls();
  const Json list = Json::parse(tree({"--json", "--only-failed"}).out);
  ASSERT_EQ(list.size(), 4U);
  EXPECT_EQ(list[1]["text"], "copyFile: \x1b[31m</script>\n");
  EXPECT_EQ(list[2], Json({{"host", "host"},
                           {"program", "program"},
                           {"pid", 7},
                           {"tid", 70},
                           {"depth", 1},
                           {"function", "checkFilePerms"},
                           {"begin", 150},
                           {"end", 160},
                           {"own", 10},
                           {"code", 32},
                           {"failed", true},
                           {"finished", true}}));
  EXPECT_EQ(list[3], Json({{"host", "host"},
                           {"program", "program"},
                           {"pid", 7},
                           {"tid", 70},
                           {"depth", 2},
                           {"function", "checkFilePerms"},
                           {"time", 155},
                           {"error", true},
                           {"text", "no"}}));
  EXPECT_EQ(tree({"--json", "--function", "x"}).out, "[]\n");
}

// Its memory does not grow with the calls in one.
TEST_F(TraceTree, ShowsACallAroundVeryManyWhenItBeginsAndWhenItEnds) {
  MadeStream stream(70);
  stream.enter(100, kCopyFile);
  for (uint64_t i = 0; i < 150'000; ++i) {
    stream.enter(200 + 2 * i, kIsDirectory).leave(201 + 2 * i, kIsDirectory, 1);
  }
  stream.leave(1'000'000, kCopyFile, 0);
  makeTrace(temp.path("t"), {stream});

  const std::string out = tree({}).out;

  EXPECT_THAT(out, HasSubstr("00:00:00.000000100  copyFile  CONTINUES\n"));
  EXPECT_THAT(out, ::testing::EndsWith("00:00:00.000000100  copyFile  1000us  = 0  FAILED\n"));
  EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 150'003);
}

TEST_F(TraceTree, HasColoursOnATerminalAlone) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  makeCalls();
  const auto onTerminal = [&](const char* no_color) {
    const Terminal terminal = openTerminal();
    const Result result = osutils({"trace", "tree", temp.path("t")}, [&] {
      dup2(terminal.subsidiary, STDOUT_FILENO);
      if (no_color == nullptr) {
        unsetenv("NO_COLOR");
      } else {
        setenv("NO_COLOR", no_color, 1);
      }
    });
    EXPECT_EQ(result.status, 0) << result.err;
    close(terminal.subsidiary);
    return readAll(terminal.manager);
  };
  const std::string text = onTerminal(nullptr);
  EXPECT_THAT(text, HasSubstr("100  copyFile  3.00ms  = 1\r\n"));
  EXPECT_THAT(text, HasSubstr("  \x1b[2m- copyFile: ?[31m</script>\x1b[0m\r\n"));
  EXPECT_THAT(text, HasSubstr("  \x1b[31mcheckFilePerms  10ns  = 32  FAILED\x1b[0m\r\n"));
  EXPECT_THAT(text, HasSubstr("  \x1b[31m! no\x1b[0m\r\n"));
  EXPECT_THAT(onTerminal(""), HasSubstr("\x1b["));
  EXPECT_THAT(onTerminal("1"), Not(HasSubstr("\x1b[")));
}

}  // namespace
