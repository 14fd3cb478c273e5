// osutils-trace as a program: how osutils finds it, and what it shows on a terminal.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "made_trace.h"
#include "tool.h"
#include "world.h"

namespace {

namespace fs = std::filesystem;
using ::testing::ContainsRegex;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

// ---- Without it ----

// A copy of osutils without the program.
class WithoutReader : public ::testing::Test {
 protected:
  WithoutReader() {
    temp.dir("bin");
    fs::copy_file(OSUTILS_TOOL, tool);
    fs::create_directory_symlink(fs::path(OSUTILS_TOOL).parent_path().parent_path() / "lib",
                                 temp.path("lib"));
  }

  const TempDir temp;
  const std::string tool = temp.path("bin/osutils");
};

TEST_F(WithoutReader, OneLineSaysWhatIsMissing) {
  for (const char* const view : {"summary", "tree"}) {
    expectFailure(runProgram({tool, "trace", view, temp.path()}),
                  std::string("osutils: trace ") + view +
                      ": unavailable (52): cannot run the program osutils-trace: No such file or "
                      "directory\n");
  }
}

TEST_F(WithoutReader, OneLineSaysWhyItCannotBeRun) {
  for (const char* const place : {"libexec/osutils", "bin"}) {
    SCOPED_TRACE(place);
    fs::create_directories(temp.path(place));
    const std::string reader = temp.file(std::string(place) + "/osutils-trace", "");
    expectFailure(runProgram({tool, "trace", "summary", temp.path()}),
                  "osutils: trace summary: unavailable (52): cannot run the program osutils-trace: "
                  "Permission denied\n");
    fs::remove(reader);
  }
}

TEST_F(WithoutReader, EverythingElseWorks) {
  EXPECT_EQ(runProgram({tool, "trace", "summary"}).status, 2);
  expectAnswer(runProgram({tool, "trace", "tree", "--help"}),
               osutils({"trace", "tree", "--help"}).out);
  EXPECT_EQ(runProgram({tool, "space", "0", temp.path()}).status, 0);
}

TEST_F(WithoutReader, ItIsFoundInEitherFolder) {
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  for (const char* const place : {"libexec/osutils", "bin"}) {
    SCOPED_TRACE(place);
    fs::create_directories(temp.path(place));
    const std::string reader = temp.path(std::string(place) + "/osutils-trace");
    writeFile(reader, "#!/bin/sh\necho \"$0 $*\"\n");
    fs::permissions(reader, fs::perms::owner_all);
    expectAnswer(runProgram({tool, "--json", "trace", "tree", "--from", "x", "a b"}),
                 reader + " --json trace tree --from x a b\n");
    fs::remove(reader);
  }
}

// ---- Options ----

TEST(TraceOptions, MayFollowThePaths) {
  const TempDir temp;
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  makeTrace(temp.path("u"), {MadeStream(70).enter(300, kCopyFile).leave(400, kCopyFile, 1)});
  const std::string from = "1970-01-01T00:00:00.0000003Z";
  const Result before =
      osutils({"trace", "tree", "--json", "--from", from, temp.path("t"), temp.path("u")});
  EXPECT_THAT(before.out, HasSubstr("\"begin\":300"));
  EXPECT_EQ(before.err, "");
  for (const Arguments& words :
       {Arguments{temp.path("t"), "--json", temp.path("u"), "--from", from},
        Arguments{temp.path("t"), "--from=" + from, "--json", "--", temp.path("u")}}) {
    Arguments arguments = {"trace", "tree"};
    arguments.insert(arguments.end(), words.begin(), words.end());
    expectAnswer(osutils(arguments), before.out);
  }

  for (const Arguments& words : {Arguments{temp.path("t"), "-o", "page.html", "--dry-run"},
                                 Arguments{temp.path("t"), "--dry-run", "--output", "page.html"}}) {
    Arguments arguments = {"trace", "report"};
    arguments.insert(arguments.end(), words.begin(), words.end());
    const Result result = osutils(arguments);
    EXPECT_THAT(result.out, HasSubstr("page.html"));
    EXPECT_EQ(result.status, 0) << result.err;
  }
  expectFailure(osutils({"trace", "report", temp.path("t"), "-or.html"}),
                HasSubstr(": unknown option \"-or.html\""));
  expectFailure(osutils({"trace", "tree", "--", "--json"}),
                HasSubstr("--json: No such file or directory"));
  expectFailure(osutils({"trace", "report", "--", temp.path("t"), "-o", "page.html"}),
                HasSubstr("--output is missing"));
}

// ---- Progress ----

class Progress : public ::testing::Test {
 protected:
  // The second of three threads has all but two of the calls.
  Progress() {
    MadeStream stream(70);
    for (uint64_t i = 1; i <= kCalls; ++i) {
      stream.enter(2 * i, kCopyFile).leave(2 * i + 1, kCopyFile, 1);
    }
    makeTrace(temp.path("t"),
              {MadeStream(69).enter(100, kCopyFile).leave(200, kCopyFile, 1), stream,
               MadeStream(71).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
  }

  // Runs the tree with this standard error. For more than a second it waits for the reader of its output.
  void readSlowly(int standard_error, uint64_t lines = kCalls + 2 + 3) const {
    int out[2];
    ASSERT_EQ(pipe2(out, O_CLOEXEC), 0);
    const std::string path = temp.path("t");
    const pid_t child = fork();
    if (child == 0) {
      dup2(out[1], STDOUT_FILENO);
      dup2(standard_error, STDERR_FILENO);
      execl(OSUTILS_TOOL, OSUTILS_TOOL, "trace", "tree", path.c_str(), nullptr);
      _exit(126);
    }
    close(out[1]);
    char first = 0;
    EXPECT_EQ(read(out[0], &first, 1), 1);
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    const std::string text = readAll(out[0]);
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), static_cast<long>(lines));
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }

  static constexpr uint64_t kCalls = 66'000;
  const TempDir temp;
};

TEST_F(Progress, IsShownOnATerminalAndRemoved) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  const Terminal terminal = openTerminal();

  readSlowly(terminal.subsidiary);

  close(terminal.subsidiary);
  const std::string text = readAll(terminal.manager);
  EXPECT_THAT(text, StartsWith("\r[##########                    ] "));  // one of three
  EXPECT_THAT(text, ContainsRegex("\\] (65536|131072) records\x1b\\[K"));
  EXPECT_THAT(text, EndsWith("records\x1b[K\r\x1b[K"));
}

// The packets of one file are more than the files.
TEST_F(Progress, HasNoBarIfThePartIsNotKnown) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  MadeStream stream(70);
  for (uint64_t i = 1; i <= kCalls; ++i) {
    stream.enter(2 * i, kCopyFile).leave(2 * i + 1, kCopyFile, 1);
    if (i % 1000 == 0) stream.endPacket();
  }
  std::filesystem::remove_all(temp.path("t"));
  makeTrace(temp.path("t"), {stream});
  const Terminal terminal = openTerminal();

  readSlowly(terminal.subsidiary, kCalls + 1);

  close(terminal.subsidiary);
  EXPECT_THAT(readAll(terminal.manager), ContainsRegex("^\r(65536|131072) records\x1b\\[K"));
}

TEST_F(Progress, IsNotShownInTheFirstSecond) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  const Terminal terminal = openTerminal();
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_EQ(osutils({"trace", "summary", temp.path("t")},
                    [terminal] { dup2(terminal.subsidiary, STDERR_FILENO); })
                .status,
            0);
  const auto time = std::chrono::steady_clock::now() - begin;
  close(terminal.subsidiary);
  const std::string text = readAll(terminal.manager);
  if (time < std::chrono::seconds(1)) {
    EXPECT_EQ(text, "");
  }
}

// Its lines would be glued to those of the answer.
TEST_F(Progress, IsNotShownAmongLinesOnTheSameTerminal) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  for (const Arguments& view : {Arguments{"tree"}, Arguments{"export", "--format", "jsonl"},
                                Arguments{"export", "--format", "chrome"}}) {
    SCOPED_TRACE(view.back());
    const Terminal terminal = openTerminal();
    std::vector<const char*> words = {OSUTILS_TOOL, "trace"};
    for (const std::string& word : view) words.push_back(word.c_str());
    const std::string path = temp.path("t");
    words.insert(words.end(), {path.c_str(), nullptr});
    const pid_t child = fork();
    if (child == 0) {
      dup2(terminal.subsidiary, STDOUT_FILENO);
      dup2(terminal.subsidiary, STDERR_FILENO);
      execv(OSUTILS_TOOL, const_cast<char**>(words.data()));
      _exit(126);
    }
    close(terminal.subsidiary);
    char first = 0;
    EXPECT_EQ(read(terminal.manager, &first, 1), 1);
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    const std::string text = first + readAll(terminal.manager);
    EXPECT_GT(std::count(text.begin(), text.end(), '\n'), static_cast<long>(kCalls));
    // The first of two readings may show it, before the answer begins.
    const size_t begin = view.back() == "chrome" ? text.find("{\"displayTimeUnit") : 0;
    ASSERT_NE(begin, std::string::npos);
    EXPECT_THAT(text.substr(begin), Not(HasSubstr("records\x1b[K")));
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
}

#ifndef SANITIZER_OWNS_MALLOC  // whose runtime must be the first library
TEST_F(Progress, IsShownOnTheTerminalOfAnAnswerThatIsNotWrittenMeanwhile) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  for (const bool is_second : {false, true}) {
    SCOPED_TRACE(is_second);
    if (is_second && access("/usr/share/nodejs/d3/dist/d3.min.js", R_OK) != 0) continue;
    const Terminal terminal = openTerminal();
    Arguments words = {"trace", is_second ? "report" : "summary", temp.path("t")};
    if (is_second) words.insert(words.end(), {"-o", temp.path("page")});
    const Result result = osutils(words, [terminal, is_second] {
      dup2(terminal.subsidiary, STDOUT_FILENO);
      dup2(terminal.subsidiary, STDERR_FILENO);
      setenv("LD_PRELOAD", SECOND_READING, 1);
      setenv(is_second ? "SECOND_READING" : "FIRST_READING", "LD_PRELOAD= ; sleep 1.1", 1);
    });
    EXPECT_EQ(result.status, 0);
    close(terminal.subsidiary);
    EXPECT_THAT(readAll(terminal.manager), HasSubstr("records\x1b[K\r\x1b[K"));
  }
}
#endif

TEST_F(Progress, IsNotShownElsewhere) {
  const std::string path = temp.path("errors");
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_NE(file, -1);

  readSlowly(file);

  close(file);
  EXPECT_EQ(contentsOf(path), "");
}

}  // namespace
