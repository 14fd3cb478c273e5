// trace report: the page as a file. What a browser does with it: `./dev browser`.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/mount.h>
#include <sys/random.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <utility>
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
  // thread, depth, begin, from first to last, calls, failed of all, time in the calls, calls in them
  std::vector<Json> merged() const { return records("merged", 8, 2); }
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

TEST_F(TraceReport, HasCodesThatANumberOfThePageCannotHoldAsTexts) {
  const int64_t most = 8'999'999'999'999'999;
  MadeStream stream(70);
  for (const int64_t code : {most, most + 1, -most, -most - 1}) {
    stream.enter(kBegin, kOwn).leave(kBegin, kOwn, code);
  }
  makeTrace(temp.path("t"), {stream});
  std::vector<Json> codes;
  for (const Json& call : made().calls()) codes.push_back(call[6]);
  EXPECT_THAT(codes, ElementsAre(most, "9000000000000000", -most, "-9000000000000000"));
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

TEST_F(TraceReport, HasElementsOnlyForTheRecordsThatThereAre) {
  const std::string begin = "<script type=\"application/json\" data-records=\"";
  makeCall();
  const std::string page = made().text;
  EXPECT_EQ(occurrences(page, begin), 1U);
  EXPECT_EQ(occurrences(page, begin + "calls\">"), 1U);
  makeTrace(temp.path("t"), {MadeStream(70)});
  EXPECT_EQ(occurrences(made({"--force"}).text, begin), 0U);
}

// ---- What it leaves out ----

TEST_F(TraceReport, NotesWhatCouldNotBeRead) {
  makeTrace(temp.path("t"),
            {MadeStream(70).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1).discard(1)});
  writeFile(temp.path("t/stream-1"), std::string(30, 'x'));
  const Result result = report({}, [this] { setenv("TMPDIR", temp.path().c_str(), 1); });
  EXPECT_EQ(result.status, 3);
  const std::string problem = temp.path("t") + ": cannot read the file stream-1";
  EXPECT_EQ(result.err,
            "osutils: trace report: " + problem +
                "\nosutils: trace report: 1 record missing: the tracer discarded them\n");
  const Page page(contentsOf(file));
  EXPECT_EQ(page.trace["notes"], Json({problem, "1 record missing: the tracer discarded them"}));
  EXPECT_EQ(page.calls().size(), 1U);
}

TEST_F(TraceReport, OfNothingIsNoPage) {
  temp.dir("t");
  expectFailure(report(), HasSubstr(temp.path("t")));
  EXPECT_THAT(filesInFolder(), ElementsAre());
}

TEST_F(TraceReport, OfTooManyMessagesHasTheErrorsAndOthersFromEverywhere) {
  MadeStream stream(70);
  constexpr uint64_t kMessages = 250'000;
  for (uint64_t i = 0; i < kMessages; ++i) {
    stream.message(kBegin + i, kCopyFile + 1, "",
                   i % 1000 == 0 ? trace::kDebugError : trace::kDebug);
  }
  makeTrace(temp.path("t"), {stream});
  const Page page = made();
  size_t errors = 0;
  int64_t last = -1;
  int64_t widest = 0;
  const std::vector<Json> messages = page.messages();
  for (const Json& message : messages) {
    if (message[3] == 1) ++errors;
    const auto time = message[2].get<int64_t>();
    widest = std::max(widest, time - last);
    last = time;
  }
  EXPECT_EQ(messages.size(), 200'000U);
  EXPECT_EQ(errors, 250U);
  EXPECT_EQ(widest, 2);
  EXPECT_EQ(last, static_cast<int64_t>(kMessages) - 1);
  EXPECT_EQ(page.trace["notes"], Json({"50000 of 250000 messages left out, because the page would "
                                       "be too large: errors come first."}));
}

#ifndef SANITIZER_OWNS_MALLOC  // with a sanitizer these take minutes

TEST_F(TraceReport, HasUpToTwoHundredThousandMessages) {
  constexpr uint64_t kMost = 200'000;
  const auto make = [&](uint64_t messages, uint64_t type) {
    MadeStream stream(70);
    for (uint64_t i = 0; i < messages; ++i) stream.message(kBegin + i, kCopyFile + 1, "", type);
    makeTrace(temp.path("t"), {stream});
    return made({"--force"});
  };
  EXPECT_EQ(make(kMost, trace::kDebug).messages().size(), kMost);
  const Page page = make(kMost + 1, trace::kDebugError);
  EXPECT_EQ(page.messages().size(), kMost);
  EXPECT_EQ(page.trace["notes"], Json({"1 of 200001 messages left out, because the page would be "
                                       "too large: errors come first."}));
}

TEST_F(TraceReport, HasUpTo64MiBOfTexts) {
  constexpr uint64_t kMost = (64 << 20) / 4096;
  // Strings, because babeltrace2 reads arrays of characters one by one.
  std::string metadata = kMadeMetadata;
  const size_t begin = metadata.find("number32 length;");
  metadata.replace(begin, metadata.find("text[length];") + 13 - begin, "string text;");
  const std::string text(5000, 't');  // counts as 4096
  MadeStream all(70);
  for (uint64_t i = 0; i < kMost; ++i) all.string(kBegin + i, kCopyFile + 1, text, trace::kDebug);
  makeTrace(temp.path("t"), {all}, metadata);
  const std::string mark = "(904 bytes more)";
  EXPECT_EQ(occurrences(made().text, mark), kMost);

  MadeStream more(70);
  more.string(kBegin, kCopyFile + 1, "ordinary", trace::kDebug);
  for (uint64_t i = 0; i <= kMost; ++i) {
    more.string(kBegin + i, kCopyFile + 1, text, trace::kDebugError);
  }
  makeTrace(temp.path("t"), {more}, metadata);
  const Page page = made({"--force"});
  EXPECT_EQ(occurrences(page.text, mark), kMost);
  EXPECT_EQ(occurrences(page.text, "ordinary"), 0U);
  EXPECT_EQ(page.trace["notes"], Json({"2 of 16386 messages left out, because the page would be "
                                       "too large: errors come first."}));
}

// What a page of more than a million calls has, reckoned from all of them.
class Thinning : public TraceReport {
 protected:
  struct MadeCall {
    int64_t thread;  // 0, 1
    int64_t depth;
    int64_t begin;  // since the first
    int64_t total;
    bool has_failed;
  };

  // In the order of their ends within each thread.
  std::vector<MadeCall> makeCalls(uint64_t of_five_fail) {
    std::vector<MadeCall> calls;
    uint64_t random = 1;
    const auto below = [&random](uint64_t bound) {
      random = random * 6364136223846793005U + 1442695040888963407U;
      return (random >> 33) % bound;
    };
    std::vector<MadeStream> streams = {MadeStream(70), MadeStream(71)};
    int64_t now[] = {0, 0};
    while (calls.size() < 1'010'000) {
      const size_t thread = below(3) == 0 ? 1 : 0;
      const int64_t begin = now[thread];
      // Most are short and of few lengths. Some failed ones are so, too.
      const auto length = static_cast<int64_t>(below(25) == 0 ? 12 + below(1000) : 8 + below(2));
      const bool has_failed = below(5) < of_five_fail || below(100) == 0;
      const bool is_nested = thread == 0 && below(10) == 0;
      const uint64_t from = kBegin + static_cast<uint64_t>(begin);
      const auto until = from + static_cast<uint64_t>(length);
      if (is_nested) streams[thread].enter(from, kCopyFile);
      streams[thread]
          .enter(from, kCheckFilePerms)
          .leave(until, kCheckFilePerms, has_failed ? 32 : 0);
      calls.push_back({static_cast<int64_t>(thread), is_nested ? 1 : 0, begin, length, has_failed});
      if (is_nested) {
        streams[thread].leave(until + 1, kCopyFile, 1);
        calls.push_back({static_cast<int64_t>(thread), 0, begin, length + 1, false});
      }
      now[thread] = begin + length + 1 + static_cast<int64_t>(below(below(50) == 0 ? 5000 : 20));
    }
    makeTrace(temp.path("t"), streams);
    return calls;
  }

  using Rows = std::vector<std::vector<int64_t>>;

  static Rows rowsOf(const std::vector<Json>& records, const std::vector<size_t>& fields) {
    Rows rows;
    for (const Json& record : records) {
      std::vector<int64_t> row;
      for (const size_t field : fields) row.push_back(record[field].get<int64_t>());
      rows.push_back(row);
    }
    std::sort(rows.begin(), rows.end());
    return rows;
  }

  // The least bound, one of 0, 1, 2, 3, 4, 5, 6, 7, 8, 10, 12, 14, 16, 20, ..., that at most so many lengths reach.
  static int64_t boundFor(std::vector<int64_t> lengths, size_t most) {
    std::sort(lengths.rbegin(), lengths.rend());
    if (lengths.size() <= most) return 0;
    const int64_t too_short = lengths[most];
    int64_t bound = 0;
    for (int64_t step = 1; bound <= too_short; bound += step) {
      if (bound >= 8 * step) step *= 2;
    }
    return bound;
  }

  static void expectLimitedElements(const std::string& text) {
    const std::string begin = "<script type=\"application/json\" data-records=\"calls\">";
    size_t larger = 0;
    for (size_t at = 0; (at = text.find(begin, at)) != std::string::npos; ++at) {
      const size_t size = text.find("</script>", at) - at - begin.size();
      EXPECT_LT(size, (256U << 10) + 200);
      if (size >= 256U << 10) ++larger;
    }
    EXPECT_GE(larger, 2U);
  }

  void expectThinned(uint64_t of_five_fail, const std::string& note) {
    const std::vector<MadeCall> calls = makeCalls(of_five_fail);
    const Page page = made();
    std::vector<int64_t> others;
    std::vector<int64_t> all;
    int64_t last = 0;
    for (const MadeCall& call : calls) {
      all.push_back(call.total);
      if (!call.has_failed) others.push_back(call.total);
      last = std::max(last, call.begin + call.total);
    }
    const size_t failed = all.size() - others.size();
    const bool are_failed_kept = failed <= 500'000;
    const int64_t bound =
        are_failed_kept ? boundFor(others, 1'000'000 - failed) : boundFor(all, 1'000'000);
    const int64_t widest_gap = last / (1'000'000 / 3);  // of three lanes: two of one thread

    // What is merged at each depth of each thread.
    struct Group {
      int64_t calls = 0;
      int64_t inner = 0;
      int64_t failed = 0;
      int64_t time = 0;
      MadeCall first = {};
      int64_t end = 0;
    };
    Group groups[2][2];
    Rows expected_calls;
    Rows expected_merged;
    const auto add = [&](const MadeCall& call) {
      expected_calls.push_back(
          {call.thread, call.depth, call.begin, call.total, call.has_failed ? kFailed : 0});
    };
    const auto end = [&](Group& group) {
      const int64_t merged = group.calls + group.inner;
      if (merged == 1) add(group.first);
      if (merged > 1) {
        expected_merged.push_back({group.first.thread, group.first.depth, group.first.begin,
                                   group.end - group.first.begin, group.calls, group.failed,
                                   group.time, group.inner});
      }
      group = Group();
    };
    for (const MadeCall& call : calls) {
      Group& group = groups[call.thread][call.depth];
      const bool is_kept = call.total >= bound || (call.has_failed && are_failed_kept);
      if (is_kept || (group.calls > 0 && call.begin - group.end > widest_gap)) end(group);
      if (is_kept) {
        if (call.depth == 0) end(groups[call.thread][1]);
        add(call);
        continue;
      }
      if (group.calls == 0) group.first = call;
      ++group.calls;
      group.time += call.total;
      if (call.has_failed) ++group.failed;
      group.end = call.begin + call.total;
      if (call.depth == 1) continue;
      const Group inner = std::exchange(groups[call.thread][1], {});
      group.inner += inner.calls;
      group.failed += inner.failed;
    }
    for (auto& thread : groups) {
      for (Group& group : thread) end(group);
    }
    std::sort(expected_calls.begin(), expected_calls.end());
    std::sort(expected_merged.begin(), expected_merged.end());

    expectLimitedElements(page.text);
    EXPECT_EQ(page.trace["threads"], Json::array({Json({0, 70}), Json({0, 71})}));
    EXPECT_TRUE(rowsOf(page.calls(), {0, 1, 3, 4, 5}) == expected_calls);
    EXPECT_TRUE(rowsOf(page.merged(), {0, 1, 2, 3, 4, 5, 6, 7}) == expected_merged);
    const auto merged =
        static_cast<int64_t>(calls.size()) - static_cast<int64_t>(expected_calls.size());
    EXPECT_GT(merged, 500'000);
    EXPECT_GT(expected_merged.size(), 1000U);
    EXPECT_EQ(page.trace["notes"][0],
              std::to_string(merged) + " of " + std::to_string(calls.size()) +
                  " calls are merged with their neighbours, with their number and failures, "
                  "because the page would be too large: those shorter than " +
                  std::to_string(bound) + "ns" + note + ". The summary has all calls.");
  }
};

TEST_F(Thinning, MergesShortCallsAndKeepsFailedOnes) { expectThinned(0, " that have not failed"); }

TEST_F(Thinning, MergesFailedOnesTooIfTheyAreMoreThanHalf) { expectThinned(3, ""); }

TEST_F(Thinning, KeepsAMillionCallsAndMergesOnlyThoseThatAreShorter) {
  constexpr uint64_t kMost = 1'000'000;
  MadeStream stream(70);
  const auto call = [&stream](uint64_t begin, uint64_t length) {
    stream.enter(begin, kCheckFilePerms).leave(begin + length, kCheckFilePerms, 0);
  };
  call(kBegin, 1);
  call(kBegin + 2, 1);
  for (uint64_t i = 1; i <= kMost; ++i) call(kBegin + 100 * i, 8);
  makeTrace(temp.path("t"), {stream});
  const Page page = made();
  EXPECT_THAT(page.merged(), ElementsAre(Json({0, 0, 0, 3, 2, 0, 2, 0})));
  EXPECT_EQ(page.calls().size(), kMost);
  EXPECT_EQ(page.trace["notes"],
            Json({"2 of 1000002 calls are merged with their neighbours, with their number and "
                  "failures, because the page would be too large: those shorter than 2ns that "
                  "have not failed. The summary has all calls."}));
}
#endif

#ifndef SANITIZER_OWNS_MALLOC  // whose runtime must be the first library

// ---- What changes between the two readings ----

class SecondReading : public TraceReport {
 protected:
  static std::function<void()> changing(const std::string& command) {
    return [command] {
      setenv("LD_PRELOAD", SECOND_READING, 1);
      setenv("SECOND_READING", ("LD_PRELOAD= ; " + command).c_str(), 1);
    };
  }
  void makeThreads() const {
    std::vector<MadeStream> streams;
    for (uint64_t thread = 70; thread < 73; ++thread) {
      streams.push_back(
          MadeStream(thread).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1));
    }
    makeTrace(temp.path("t"), streams);
  }
};

TEST_F(SecondReading, LosesRecordsThatWereThere) {
  makeThreads();
  const std::string missing = "2 records missing that were there when the trace was read first";
  const auto removal = changing("rm '" + temp.path("t/stream-1") + "'");
  Result result = report({}, removal);
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err, "osutils: trace report: " + missing + "\n");
  const Page page(contentsOf(file));
  EXPECT_EQ(page.trace["notes"], Json({missing + ": the summary counts them"}));
  EXPECT_EQ(page.calls().size(), 2U);
  EXPECT_EQ(page.trace["summary"][0]["calls"], 3);

  makeThreads();
  result = osutils({"trace", "export", "--format", "chrome", temp.path("t")}, removal);
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err, "osutils: trace export: " + missing + "\n");
  EXPECT_EQ(occurrences(result.out, "\"ph\":\"X\""), 2U);
}

TEST_F(SecondReading, CannotReadWhatCouldBeRead) {
  makeThreads();
  const Result result = report({}, [&] {
    changing("truncate -s 100 '" + temp.path("t/stream-1") + "'")();
    setenv("TMPDIR", temp.path().c_str(), 1);
  });
  EXPECT_EQ(result.status, 3);
  const std::string missing = "2 records missing that were there when the trace was read first";
  const std::string problem = temp.path("t") + ": cannot read the file stream-1";
  EXPECT_EQ(result.err,
            "osutils: trace report: " + problem + "\nosutils: trace report: " + missing + "\n");
  EXPECT_EQ(Page(contentsOf(file)).trace["notes"],
            Json({missing + ": the summary counts them", problem}));
}

TEST_F(SecondReading, FindsMoreIfTheTraceHasGrown) {
  const MadeStream unfinished = MadeStream(80).enter(kBegin, kCopyFile);
  const MadeStream whole = MadeStream(80).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1);
  for (const auto& [added, records] :
       {std::pair(unfinished, "1 record"), std::pair(whole, "2 records")}) {
    SCOPED_TRACE(records);
    fs::remove_all(temp.path("t"));
    fs::remove(file);
    makeThreads();
    makeTrace(temp.path("more"), {added});
    const Result result = report(
        {}, changing("cp '" + temp.path("more/stream-0") + "' '" + temp.path("t/stream-3") + "'"));
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    const Page page(contentsOf(file));
    EXPECT_EQ(page.trace["notes"],
              Json({std::string("the trace grew while it was read: the summary lacks the last ") +
                    records}));
    EXPECT_EQ(page.calls().size(), 4U);
  }
}

// What a flight recorder does.
TEST_F(SecondReading, LosesTheOldestRecordsAndFindsNewerOnes) {
  const auto make = [this](const char* name, uint64_t first, uint64_t last) {
    MadeStream stream(70);
    for (uint64_t i = first; i <= last; ++i) {
      stream.enter(kBegin + 10 * i, kCopyFile).leave(kBegin + 10 * i + 5, kCopyFile, 1);
    }
    makeTrace(temp.path(name), {stream});
  };
  for (const auto& [last, added] : {std::pair(25U, 30U), std::pair(15U, 10U)}) {
    SCOPED_TRACE(last);
    make("t", 1, 10);
    make("more", 6, last);
    fs::remove(file);
    const Result result = report(
        {}, changing("cp '" + temp.path("more/stream-0") + "' '" + temp.path("t/stream-0") + "'"));
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(Page(contentsOf(file)).trace["notes"],
              Json({"10 records missing that were there when the trace was read first: the summary "
                    "counts them",
                    "the trace grew while it was read: the summary lacks the last " +
                        std::to_string(added) + " records"}));
  }
}
#endif

TEST_F(TraceReport, NotesHowManyFilesCouldNotBeRead) {
  std::vector<MadeStream> streams;
  for (uint64_t thread = 70; thread < 83; ++thread) {
    streams.push_back(MadeStream(thread).enter(kBegin, kCopyFile).leave(kBegin + 5, kCopyFile, 1));
  }
  makeTrace(temp.path("t"), streams);
  for (int i = 0; i < 12; ++i) fs::resize_file(temp.path("t/stream-" + std::to_string(i)), 100);
  EXPECT_EQ(report({}, [this] { setenv("TMPDIR", temp.path().c_str(), 1); }).status, 3);
  const Json notes = Page(contentsOf(file)).trace["notes"];
  EXPECT_EQ(notes.size(), 11U);
  EXPECT_EQ(notes.back(), "and 2 more that could not be read");
}

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

TEST_F(TraceReport, WithoutRandomNumbersThereIsNoPage) {
  makeCall();
  const auto fail = [] { failSystemCall(SYS_getrandom, 2, 0, ENOSYS); };
  const int fails = inChild([&] {
    fail();
    char number = 0;
    return getrandom(&number, sizeof number, 0) == -1 ? 0 : 1;
  });
  if (fails != 0) GTEST_SKIP() << "the C library gets them without a system call";
  expectFailure(report({}, fail),
                "osutils: trace report: operations error (1): no random numbers: Function not "
                "implemented\n");
  EXPECT_THAT(filesInFolder(), ElementsAre());
}

// ---- File systems without files that have no name ----

class WithoutUnnamedFiles : public TraceReport {
 protected:
  unsigned error = EOPNOTSUPP;

  Result reportThere(
      const Arguments& options, const std::function<void()>& prepare = [] {}) const {
    return report(options, [&] {
      failSystemCall(SYS_openat, 2, O_TMPFILE | O_WRONLY | O_CLOEXEC, error);
      prepare();
    });
  }
};

TEST_F(WithoutUnnamedFiles, ThePageIsMadeAndReplaced) {
  makeCall();
  for (const char* const option : {"--from=2000-01-01T00:00:00Z", "--force"}) {
    const Result result = reportThere({option});
    error = EISDIR;  // from a kernel without them
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
              const std::string other = temp.file("d3", "");
              EXPECT_EQ(mount(other.c_str(), kD3, nullptr, MS_BIND, nullptr), 0);
              for (const std::string mark : {"</script", "</SCRIPT", "<!--"}) {
                writeFile(other, "x = '" + mark + ">'");
                expectFailure(
                    osutils({"trace", "report", "-o", temp.path("page.html"), temp.path("t")}),
                    std::string("osutils: trace report: unwilling to perform (53): ") + kD3 +
                        " contains " + mark + "\n");
              }
              return 0;
            }),
            0);
}

}  // namespace
