// trace report: the page as a file. What a browser does with it: `./dev browser`.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/mount.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <vector>

#include "made_trace.h"
#include "report_page.h"
#include "system_call_filter.h"
#include "tool.h"
#include "world.h"

namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using Json = nlohmann::json;

constexpr const char* kD3 = "/usr/share/nodejs/d3/dist/d3.min.js";

constexpr uint64_t kCopyFile = trace::functionId(6, 7);        // a success flag
constexpr uint64_t kIsDirectory = trace::functionId(6, 3);     // yes or no
constexpr uint64_t kCheckFilePerms = trace::functionId(6, 6);  // a code
constexpr uint64_t kOwn = 0x12340000;                          // of a program
constexpr uint64_t kSecond = 1'000'000'000;
constexpr uint64_t kBegin = 1'700'000'000 * kSecond;

// The bits of a call's state in the page.
constexpr int kFailed = 1;
constexpr int kUnknown = 2;
constexpr int kUnfinished = 4;
constexpr int kNoEntry = 8;

size_t occurrences(const std::string& text, const std::string& part) {
  size_t count = 0;
  for (size_t at = 0; (at = text.find(part, at)) != std::string::npos; at += part.size()) ++count;
  return count;
}

// What the element that begins so contains.
std::vector<Json> elements(const std::string& page, const std::string& begin) {
  std::vector<Json> found;
  for (size_t at = 0; (at = page.find(begin, at)) != std::string::npos;) {
    at += begin.size();
    found.push_back(Json::parse(page.substr(at, page.find("</script>", at) - at)));
  }
  return found;
}

struct Page {
  explicit Page(std::string contents) : text(std::move(contents)) {
    if (!isPage(text)) {
      ADD_FAILURE() << "no whole page: " << text.substr(0, 1000);
      return;
    }
    trace = elements(text, "<script type=\"application/json\" id=\"trace\">").at(0);
  }

  // [field, field, ...] for each record, with times since the first record of the page.
  std::vector<Json> records(const std::string& name, size_t fields, size_t time_field) const {
    std::vector<Json> found;
    for (const Json& chunk :
         elements(text, "<script type=\"application/json\" data-records=\"" + name + "\">")) {
      int64_t time = 0;
      EXPECT_EQ(chunk.size() % fields, 0U);
      for (size_t i = 0; i + fields <= chunk.size(); i += fields) {
        Json record(chunk.begin() + static_cast<long>(i),
                    chunk.begin() + static_cast<long>(i + fields));
        time += record[time_field].get<int64_t>();
        record[time_field] = time;
        found.push_back(record);
      }
    }
    return found;
  }
  // thread, depth, function, begin, duration, state, code
  std::vector<Json> calls() const { return records("calls", 7, 3); }
  // thread, depth, begin, duration, calls, failed calls
  std::vector<Json> merged() const { return records("merged", 6, 2); }
  // thread, depth, time, is error, function, text
  std::vector<Json> messages() const { return records("messages", 6, 2); }

  std::string text;
  Json trace;
};

class TraceReport : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!pathExists(kD3)) GTEST_SKIP() << "node-d3 is not installed";
  }

  Result report(
      Arguments options = {}, const std::function<void()>& prepare = [] {}) const {
    options.insert(options.begin(), {"trace", "report", "-o", file});
    options.push_back(temp.path("t"));
    return osutils(options, prepare);
  }
  Page made(const Arguments& options = {}) const {
    const Result result = report(options);
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, "");
    return Page(contentsOf(file));
  }

  void makeCall() const {
    makeTrace(
        temp.path("t"),
        {MadeStream(70).enter(kBegin, kCheckFilePerms).leave(kBegin + 5, kCheckFilePerms, 32)});
  }
  std::set<std::string> filesInFolder() const {
    std::set<std::string> names;
    for (const auto& entry : fs::directory_iterator(folder)) names.insert(entry.path().filename());
    return names;
  }

  const TempDir temp;
  const std::string folder = temp.dir("pages");
  const std::string file = folder + "/page.html";
};

// ---- What the page has ----

TEST_F(TraceReport, HasTheCallsInTheOrderOfTheirEnds) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kBegin, kCopyFile)
                                 .enter(kBegin + 2'000, kCheckFilePerms)
                                 .leave(kBegin + 5'007, kCheckFilePerms, 32)
                                 .enter(kBegin + 6'000, kIsDirectory)
                                 .enter(kBegin + 6'010, kOwn)
                                 .leave(kBegin + 6'030, kOwn, 10'000'000'000'000'000)
                                 .leave(kBegin + 6'050, kIsDirectory, 1)
                                 .leave(kBegin + 3 * kSecond, kCopyFile, 1)
                                 .leave(kBegin + 4 * kSecond, kCheckFilePerms, 0)
                                 .enter(kBegin + 5 * kSecond, kCopyFile)
                                 .other(kBegin + 6 * kSecond)});
  const Result result = report();
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "osutils: trace report: 1 event not of traced functions left out\n");
  const Page made(contentsOf(file));
  const Json null;

  EXPECT_THAT(made.calls(),
              ElementsAre(Json({0, 1, 0, 2'000, 3'007, kFailed, 32}),
                          Json({0, 2, 1, 6'010, 20, kUnknown, "10000000000000000"}),
                          Json({0, 1, 2, 6'000, 50, 0, 1}), Json({0, 0, 3, 0, 3 * kSecond, 0, 1}),
                          Json({0, 0, 0, 4 * kSecond, 0, kNoEntry, 0}),
                          Json({0, 0, 3, 5 * kSecond, 0, kUnfinished, null})));
  EXPECT_EQ(made.trace["functions"],
            Json({"checkFilePerms", "0x12340000", "isDirectory", "copyFile"}));
  EXPECT_EQ(made.trace["start"], std::to_string(kBegin));
  EXPECT_EQ(made.trace["processes"], Json::array({Json({"host", "program", 7})}));
  EXPECT_EQ(made.trace["threads"], Json::array({Json({0, 70})}));
  EXPECT_EQ(made.trace["notes"], Json({"1 event not of traced functions left out"}));
  EXPECT_THAT(made.merged(), ElementsAre());
}

TEST_F(TraceReport, HasTheSummaryOfAllCalls) {
  makeCall();
  const Json row = made().trace["summary"][0];
  const Json expected =
      Json::parse(osutils({"trace", "summary", "--json", temp.path("t")}).out)["functions"][0];
  for (const auto& [key, value] : expected.items()) {
    EXPECT_EQ(row[key], key == "longest_at" ? Json(std::to_string(kBegin)) : value) << key;
  }
}

TEST_F(TraceReport, SaysWhatItHas) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kBegin, kCheckFilePerms)
                                 .message(kBegin + 1, kCheckFilePerms + 1, "text")
                                 .leave(kBegin + 5, kCheckFilePerms, 32)
                                 .enter(kBegin + 6, kCheckFilePerms)
                                 .leave(kBegin + 7, kCheckFilePerms, 0)});
  const Json expected = {{"report", file}, {"calls", 2}, {"failed", 1}, {"messages", 1}};
  const Result dry = report({"--dry-run", "--json"});
  EXPECT_EQ(dry.status, 0) << dry.err;
  EXPECT_EQ(Json::parse(dry.out), expected);
  EXPECT_THAT(filesInFolder(), ElementsAre());
  const Result result = report({"--json"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(Json::parse(result.out), expected);
}

TEST_F(TraceReport, HasNothingThatEndsAnElement) {
  std::string metadata = kMadeMetadata;
  const size_t host = metadata.find("\"host\"");
  metadata.replace(host, 6, R"("</script><b>")");
  const std::string names = temp.file("names", "0x12340000 </script><i>\xff\n");
  makeTrace(temp.path("t"),
            {MadeStream(70)
                 .enter(kBegin, kOwn)
                 .message(kBegin + 3, kOwn + 1, "\"\\\x1b[31m</script><!--<script>\n\xff\xc3\xa9")
                 .message(kBegin + 5, kOwn + 0x11, std::string(4097, 'x'), trace::kDebugError)
                 .leave(kBegin + 7, kOwn, 0)},
            metadata);
  const Page page = made({"--names", names});

  EXPECT_EQ(occurrences(page.text, "<script"), occurrences(page.text, "</script>"));
  EXPECT_EQ(occurrences(page.text, "<!--"), 0U);
  EXPECT_EQ(occurrences(page.text, "<b>") + occurrences(page.text, "<i>"), 0U);
  EXPECT_EQ(page.trace["processes"][0][0], "</script><b>");
  EXPECT_EQ(page.trace["functions"][0], "</script><i>\xef\xbf\xbd");
  EXPECT_THAT(
      page.messages(),
      ElementsAre(Json({0, 1, 3, 0, 0, "\"\\\x1b[31m</script><!--<script>\n\xef\xbf\xbd\xc3\xa9"}),
                  Json({0, 1, 5, 1, 0, std::string(4096, 'x') + " … (1 bytes more)"})));
}

TEST_F(TraceReport, IsOneFileThatPermitsNoRequest) {
  makeCall();
  const std::string first = made().text;
  EXPECT_THAT(first, HasSubstr("content=\"default-src 'none'; script-src 'nonce-"));
  EXPECT_EQ(occurrences(first, " src=") + occurrences(first, "<link"), 0U);
  for (const char* const place : {"@NONCE@", "@STYLE@", "@RECORDS@", "@D3@", "@SCRIPT@"}) {
    EXPECT_EQ(occurrences(first, place), 0U);
  }
  EXPECT_THAT(first, HasSubstr(contentsOf(kD3)));
  const std::string second = made({"--force"}).text;
  EXPECT_NE(first, second) << "a message could know what permits scripts";
  EXPECT_EQ(withoutNonce(first), withoutNonce(second));
}

TEST_F(TraceReport, MergesTraces) {
  std::string metadata = kMadeMetadata;
  metadata.replace(metadata.find("\"host\""), 6, "\"other\"");
  makeTrace(temp.path("t/a"),
            {MadeStream(70).enter(kBegin + 100, kCopyFile).leave(kBegin + 300, kCopyFile, 1),
             MadeStream(71).enter(kBegin + 150, kCopyFile).leave(kBegin + 160, kCopyFile, 1)});
  makeTrace(temp.path("u"),
            {MadeStream(70).enter(kBegin, kIsDirectory).leave(kBegin + 20, kIsDirectory, 0)},
            metadata);
  const Page page = made({temp.path("u")});
  EXPECT_EQ(page.trace["start"], std::to_string(kBegin));
  std::set<Json> calls;
  for (const Json& call : page.calls()) {
    const Json& thread = page.trace["threads"][call[0].get<size_t>()];
    calls.insert(Json::array({page.trace["processes"][thread[0].get<size_t>()][0], thread[1],
                              page.trace["functions"][call[2].get<size_t>()], call[3]}));
  }
  EXPECT_THAT(calls,
              ElementsAre(Json({"host", 70, "copyFile", 100}), Json({"host", 71, "copyFile", 150}),
                          Json({"other", 70, "isDirectory", 0})));
}

TEST_F(TraceReport, HasTheCallsOfTheRange) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(kBegin, kCopyFile)
                                 .leave(kBegin + 5, kCopyFile, 1)
                                 .enter(kBegin + kSecond, kIsDirectory)
                                 .leave(kBegin + kSecond + 5, kIsDirectory, 1)});
  const Page page = made({"--from", "2023-11-14T22:13:21Z"});
  EXPECT_EQ(page.trace["functions"], Json({"isDirectory"}));
  EXPECT_EQ(page.trace["summary"].size(), 1U);
  EXPECT_EQ(page.trace["start"], std::to_string(kBegin + kSecond));
}

TEST_F(TraceReport, OfATraceWithoutCallsIsAPage) {
  makeTrace(temp.path("t"), {MadeStream(70)});
  const Page page = made();
  EXPECT_THAT(page.calls(), ElementsAre());
  EXPECT_EQ(page.trace["summary"], Json::array());
}

// ---- What it leaves out ----

TEST_F(TraceReport, NotesWhatCouldNotBeRead) {
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1).discard(3)});
  writeFile(temp.path("t/stream-1"), std::string(30, 'x'));
  const Result result = report({}, [this] { setenv("TMPDIR", temp.path().c_str(), 1); });
  EXPECT_EQ(result.status, 3);
  const std::string problem = temp.path("t") + ": cannot read the file stream-1";
  EXPECT_EQ(result.err,
            "osutils: trace report: " + problem +
                "\nosutils: trace report: 3 records missing: the tracer discarded them\n");
  const Page page(contentsOf(file));
  EXPECT_EQ(page.trace["notes"], Json({problem, "3 records missing: the tracer discarded them"}));
  EXPECT_EQ(page.calls().size(), 1U);
}

TEST_F(TraceReport, OfNothingIsNoPage) {
  temp.dir("t");
  expectFailure(report(), HasSubstr(temp.path("t")));
  EXPECT_THAT(filesInFolder(), ElementsAre());
}

TEST_F(TraceReport, KeepsOnlyErrorsOfTooManyMessages) {
  MadeStream stream(70);
  constexpr uint64_t kMessages = 200'001;
  for (uint64_t i = 0; i < kMessages; ++i) {
    stream.message(kBegin + i, kCopyFile + 1, "",
                   i % 1000 == 0 ? trace::kDebugError : trace::kDebug);
  }
  makeTrace(temp.path("t"), {stream});
  const Page page = made();
  EXPECT_EQ(page.messages().size(), 201U);
  for (const Json& message : page.messages()) EXPECT_EQ(message[3], 1);
  EXPECT_EQ(page.trace["notes"], Json({"199800 of 200001 messages left out, because the page would "
                                       "be too large: errors come first."}));
}

#ifndef SANITIZER_OWNS_MALLOC  // with a sanitizer this takes a minute
TEST_F(TraceReport, MergesShortCallsAndKeepsFailedOnes) {
  MadeStream stream(70);
  constexpr uint64_t kCalls = 1'010'000;
  uint64_t time = kBegin;
  for (uint64_t i = 0; i < kCalls; ++i, time += 1000) {
    // Of 101 calls one fails, and one is longer.
    stream.enter(time, kCheckFilePerms)
        .leave(time + (i % 101 == 1 ? 900 : 10), kCheckFilePerms, i % 101 == 0 ? 32 : 0);
  }
  makeTrace(temp.path("t"), {stream});
  const Page page = made();
  const std::vector<Json> calls = page.calls();
  uint64_t failed = 0;
  uint64_t longer = 0;
  for (const Json& call : calls) {
    if (call[5] == kFailed) ++failed;
    if (call[4] == 900) ++longer;
  }
  EXPECT_EQ(failed, 10'000U);
  EXPECT_EQ(longer, 10'000U);
  uint64_t merged = 0;
  for (const Json& group : page.merged()) {
    merged += group[4].get<uint64_t>();
    EXPECT_EQ(group[5], 0);
  }
  EXPECT_EQ(calls.size() + merged, kCalls);
  EXPECT_GT(merged, 900'000U);
  EXPECT_EQ(page.trace["summary"][0]["calls"], kCalls);
  EXPECT_EQ(page.trace["notes"][0],
            std::to_string(merged) +
                " of 1010000 calls are merged with their neighbours, with their number and "
                "failures, because the page would be too large: those shorter than 12ns that "
                "have not failed. The summary has all calls.");
}
#endif

// ---- The file ----

TEST_F(TraceReport, TheFileMayBeNamedAfterThePaths) {
  makeCall();
  const Result result = osutils({"trace", "report", temp.path("t"), "-o", file});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_THAT(result.out, HasSubstr("\n" + file + "  1 "));
  EXPECT_TRUE(isPage(contentsOf(file)));
}

TEST_F(TraceReport, WithoutAFileIsWrongUsage) {
  makeCall();
  expectFailure(osutils({"trace", "report", temp.path("t")}),
                "osutils: trace report: parameter error (89): --output is missing: the file for "
                "the report\n");
}

TEST_F(TraceReport, OnlyTheOwnerMayReadIt) {
  makeCall();
  EXPECT_EQ(report({}, [] { umask(0); }).status, 0);
  EXPECT_EQ(modeOf(file), 0600U);
}

TEST_F(TraceReport, ANameWithoutAFolderIsOfTheCurrentOne) {
  makeCall();
  const Result result = osutils({"trace", "report", "-o", "page.html", temp.path("t")},
                                [this] { (void)!chdir(folder.c_str()); });
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_THAT(filesInFolder(), ElementsAre("page.html"));
}

TEST_F(TraceReport, ReplacesOnlyIfItIsToldTo) {
  makeCall();
  writeFile(file, "older page");
  expectFailure(report(), "osutils: trace report: already exists (68): " + file +
                              " exists; --force replaces it\n");
  EXPECT_EQ(contentsOf(file), "older page");
  const Page replaced = made({"--force"});
  EXPECT_EQ(replaced.calls().size(), 1U);
  EXPECT_EQ(modeOf(file), 0600U);
  EXPECT_THAT(filesInFolder(), ElementsAre("page.html"));
}

TEST_F(TraceReport, ReplacesNothingButFiles) {
  makeCall();
  const std::string target = temp.file("target", "other text");
  fs::create_symlink(target, file);
  for (const char* const option : {"--dry-run", "--force"}) {
    SCOPED_TRACE(option);
    expectFailure(report({option}), HasSubstr(file));
  }
  expectFailure(report({"--force"}), HasSubstr(file + " is not a regular file"));
  EXPECT_TRUE(fs::is_symlink(file));
  EXPECT_EQ(contentsOf(target), "other text");
}

TEST_F(TraceReport, AMissingFolderIsAFailure) {
  makeCall();
  expectFailure(osutils({"trace", "report", "-o", temp.path("none/page.html"), temp.path("t")}),
                "osutils: trace report: operations error (1): cannot make a file beside " +
                    temp.path("none/page.html") + ": No such file or directory\n");
}

TEST_F(TraceReport, AFullDiskLeavesNoHalfPage) {
  makeCall();
  for (const bool has_older : {false, true}) {
    if (has_older) writeFile(file, "older page");
    for (const rlim_t bytes : {rlim_t{1000}, rlim_t{200'000}}) {  // at the end, and in the middle
      SCOPED_TRACE(bytes);
      expectFailure(report({"--force"}, [bytes] { limitFileSize(bytes); }),
                    "osutils: trace report: operations error (1): cannot write to " + file +
                        ": File too large\n");
      EXPECT_EQ(filesInFolder(),
                has_older ? std::set<std::string>{"page.html"} : std::set<std::string>());
    }
  }
  EXPECT_EQ(contentsOf(file), "older page");
}

// ---- File systems without files that have no name ----

class WithoutUnnamedFiles : public TraceReport {
 protected:
  Result reportThere(
      const Arguments& options, const std::function<void()>& prepare = [] {}) const {
    return report(options, [&] {
      failSystemCall(SYS_openat, 2, O_TMPFILE | O_WRONLY | O_CLOEXEC, EOPNOTSUPP);
      prepare();
    });
  }
};

TEST_F(WithoutUnnamedFiles, ThePageIsMadeAndReplaced) {
  makeCall();
  for (const char* const option : {"--from=2000-01-01T00:00:00Z", "--force"}) {
    const Result result = reportThere({option});
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_TRUE(isPage(contentsOf(file)));
    EXPECT_EQ(modeOf(file), 0600U);
    EXPECT_THAT(filesInFolder(), ElementsAre("page.html"));
  }
}

TEST_F(WithoutUnnamedFiles, NorRenamesThatDoNotReplace) {
  makeCall();
  const Result result =
      reportThere({}, [] { failSystemCall(SYS_renameat2, 4, RENAME_NOREPLACE, EINVAL); });
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_TRUE(isPage(contentsOf(file)));
  EXPECT_THAT(filesInFolder(), ElementsAre("page.html"));
}

TEST_F(WithoutUnnamedFiles, AFailureLeavesNothing) {
  makeCall();
  expectFailure(reportThere({}, [] { limitFileSize(200'000); }), HasSubstr("File too large"));
  EXPECT_THAT(filesInFolder(), ElementsAre());
  expectFailure(reportThere({}, [] { failSystemCall(SYS_renameat2, 4, RENAME_NOREPLACE, EIO); }),
                "osutils: trace report: operations error (1): cannot make " + file +
                    ": Input/output error\n");
  EXPECT_THAT(filesInFolder(), ElementsAre());
}

// ---- Without D3 ----

TEST(TraceReportWithoutD3, OneLineSaysWhichPackageHasIt) {
  const TempDir temp;
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1)});
  const auto expectLine = [&] {
    expectFailure(osutils({"trace", "report", "-o", temp.path("page.html"), temp.path("t")}),
                  std::string("osutils: trace report: unavailable (52): cannot read D3 in ") + kD3 +
                      "; the package node-d3 has it\n");
    EXPECT_FALSE(pathExists(temp.path("page.html")));
  };
  if (!pathExists(kD3)) {
    expectLine();
    return;
  }
  REQUIRE_ROOT("to hide D3 behind a mount");
  EXPECT_EQ(withPrivateMounts([&] {
              const std::string folder = fs::path(kD3).parent_path();
              EXPECT_EQ(mount("tmpfs", folder.c_str(), "tmpfs", 0, nullptr), 0);
              expectLine();
              writeFile(kD3, "");  // as good as none
              expectLine();
              return 0;
            }),
            0);
}

TEST(TraceReportWithoutD3, ACopyThatWouldEndItsElementIsNotUsed) {
  if (!pathExists(kD3)) GTEST_SKIP() << "node-d3 is not installed";
  REQUIRE_ROOT("to put another copy in its place");
  const TempDir temp;
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1)});
  EXPECT_EQ(withPrivateMounts([&] {
              const std::string other = temp.file("d3", "x = '</script>'");
              EXPECT_EQ(mount(other.c_str(), kD3, nullptr, MS_BIND, nullptr), 0);
              expectFailure(
                  osutils({"trace", "report", "-o", temp.path("page.html"), temp.path("t")}),
                  HasSubstr(std::string(kD3) + " contains </script"));
              return 0;
            }),
            0);
}

}  // namespace
