// How the trace commands read what other tracers write: other contexts, fields and packets than libtrc's.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

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

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::Not;
using Json = nlohmann::json;

template <typename Number>
std::string bytesOf(Number number) {
  return {reinterpret_cast<const char*>(&number), sizeof number};
}

// An event of the made metadata: its context comes after the header.
std::string event(uint32_t id, uint64_t time, const std::string& context,
                  const std::vector<uint64_t>& fields) {
  std::string bytes = bytesOf(id) + bytesOf(time) + context;
  for (const uint64_t field : fields) bytes += bytesOf(field);
  return bytes;
}
std::string enter(uint64_t time, const std::string& context, uint64_t function = kCopyFile) {
  return event(0, time, context, {trace::kEntry33, function, 0});
}
std::string leave(uint64_t time, const std::string& context, uint64_t function = kCopyFile) {
  return event(1, time, context, {trace::kExit33, function, 0, 1});
}

// A packet whose context says no thread.
std::string packet(const std::string& events, uint32_t stream = 0, uint64_t instance = 0) {
  const uint64_t bits = 8 * (2 * sizeof(uint32_t) + 5 * sizeof(uint64_t) + events.size());
  std::string bytes = bytesOf(uint32_t{0xC1FC1FC1}) + bytesOf(stream) + bytesOf(instance);
  for (const uint64_t field : {bits, bits, uint64_t{0}, uint64_t{1'000'000}})
    bytes += bytesOf(field);
  return bytes + events;
}

std::string replaced(std::string text, const std::string& old, const std::string& with) {
  const size_t at = text.find(old);
  EXPECT_NE(at, std::string::npos) << old;
  return text.replace(at, old.size(), with);
}

const std::string kEventHeader = "  event.header";
// The made metadata without a thread in the packets, and with this context of each event.
std::string metadataWith(const std::string& context) {
  return replaced(replaced(kMadeMetadata, " number64 events_discarded; number64 tid;", ""),
                  kEventHeader, "  event.context := struct { " + context + " };\n" + kEventHeader);
}

class TraceReading : public ::testing::Test {
 protected:
  void make(const std::string& folder, const std::string& metadata,
            const std::vector<std::string>& streams) const {
    std::filesystem::create_directories(temp.path(folder));
    writeFile(temp.path(folder + "/metadata"), metadata);
    for (size_t i = 0; i < streams.size(); ++i) {
      writeFile(temp.path(folder + "/stream-" + std::to_string(i)), streams[i]);
    }
  }
  Result run(Arguments arguments) const {
    arguments.insert(arguments.begin(), "trace");
    arguments.push_back(temp.path("t"));
    return osutils(arguments, [this] { setenv("TMPDIR", temp.path().c_str(), 1); });
  }
  // Calls and messages in the order in which they end.
  std::vector<Json> lines() const {
    const Result result = run({"export", "--format", "jsonl"});
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, "");
    std::istringstream text(result.out);
    std::vector<Json> objects;
    for (std::string line; std::getline(text, line);) objects.push_back(Json::parse(line));
    return objects;
  }

  const TempDir temp;
};

// ---- Whose records they are ----

TEST_F(TraceReading, TheProgramProcessAndThreadAreThoseOfTheContext) {
  struct Case {
    std::string context;
    std::string bytes;
    Json program;
    Json pid;
    Json tid;
  };
  const std::string name = "integer { size = 8; align = 8; encoding = UTF8; } procname[8];";
  const std::string padded("ab\0\0cd\0\0", 8);
  const Case cases[] = {
      {"number32 vpid; number32 vtid; " + name, bytesOf(50) + bytesOf(51) + padded, "ab", 50, 51},
      {"number32 pid; number32 tid;", bytesOf(60) + bytesOf(61), "program", 60, 61},
      {"number32 pid; number32 vpid; number32 tid; number32 vtid;",
       bytesOf(1) + bytesOf(70) + bytesOf(2) + bytesOf(71), "program", 70, 71},
      {"string procname;", std::string("text\0", 5), "text", 7, 0},
      {"number32 procname; string vpid; number32 other;", bytesOf(1) + "x" + '\0' + bytesOf(2),
       "program", 7, 0},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.context);
    make("t", metadataWith(one.context), {packet(enter(100, one.bytes) + leave(200, one.bytes))});
    const std::vector<Json> calls = lines();
    ASSERT_EQ(calls.size(), 1U);
    EXPECT_EQ(calls[0]["program"], one.program);
    EXPECT_EQ(calls[0]["pid"], one.pid);
    EXPECT_EQ(calls[0]["tid"], one.tid);
    EXPECT_EQ(calls[0]["end"], 200);
  }
}

TEST_F(TraceReading, TheContextOfAnEventComesBeforeThatOfAllEvents) {
  std::string metadata = metadataWith("number32 vpid; number32 vtid;");
  for (const char* const id : {"id = 0; stream_id", "id = 1; stream_id"}) {
    metadata = replaced(metadata, id, std::string("context := struct { number32 vtid; }; ") + id);
  }
  const std::string both = bytesOf(50) + bytesOf(51) + bytesOf(52);
  make("t", metadata, {packet(enter(100, both) + leave(200, both))});
  const std::vector<Json> calls = lines();
  ASSERT_EQ(calls.size(), 1U);
  EXPECT_EQ(calls[0]["pid"], 50);
  EXPECT_EQ(calls[0]["tid"], 52);
}

TEST_F(TraceReading, ThreadsOfTracesWithDifferentIdsAreDifferent) {
  const std::string context = bytesOf(50) + bytesOf(51);
  const auto add = [&](const std::string& folder, const std::string& host, const char* digit,
                       const std::string& events) {
    const std::string uuid = std::string("0000000") + digit + "-0000-0000-0000-000000000000";
    std::string bytes;
    for (const int byte : {0, 0, 0, atoi(digit)}) bytes += static_cast<char>(byte);
    bytes += std::string(12, '\0');
    std::string metadata = metadataWith("number32 vpid; number32 vtid;");
    metadata = replaced(metadata, "byte_order = le;", "byte_order = le; uuid = \"" + uuid + "\";");
    metadata = replaced(metadata, "\"host\"", '"' + host + '"');
    make("t/" + folder, metadata, {packet(events, 0, 0), packet("", 0, 1)});
  };
  // One trace in two folders, as parts of it have them, and between them another one.
  add("a", "one", "1", enter(100, context));
  add("b", "two", "2", leave(200, context));
  add("c", "one", "1", leave(300, context));
  const std::vector<Json> calls = lines();
  ASSERT_EQ(calls.size(), 2U);
  EXPECT_EQ(calls[0]["host"], "two");
  EXPECT_EQ(calls[0]["begin"], Json());
  EXPECT_EQ(calls[1]["host"], "one");
  EXPECT_EQ(calls[1]["begin"], 100);
  EXPECT_EQ(calls[1]["end"], 300);
}

// A thread's records are in the streams of the processors that it was on, and the packets do not name it.
TEST_F(TraceReading, RecordsOfAThreadInSeveralStreamsAreReadInTheOrderOfTime) {
  const std::string context = bytesOf(50) + bytesOf(51);
  std::string metadata = metadataWith("number32 vpid; number32 vtid;");
  const std::string first = packet(enter(100, context) + leave(400, context));
  const std::string second =
      packet(enter(200, context, kIsDirectory) + leave(300, context, kIsDirectory), 0, 1);
  make("t", metadata, {first, second});
  const auto expectNested = [this] {
    const std::vector<Json> calls = lines();
    ASSERT_EQ(calls.size(), 2U);
    EXPECT_EQ(calls[0]["function"], "isDirectory");
    EXPECT_EQ(calls[0]["depth"], 1);
    EXPECT_EQ(calls[1]["own"], 200);
  };
  expectNested();

  // Also if another kind of streams, of which there is none, has packets with a thread.
  const size_t begin = metadata.find("stream {");
  std::string other = metadata.substr(begin, metadata.find("event {", begin) - begin);
  other = replaced(replaced(other, "id = 0;", "id = 1;"), "number64 content_size;",
                   "number64 tid; number64 content_size;");
  make("t", metadata + other, {first, second});
  expectNested();
}

// ---- Calls that are not complete ----

TEST_F(TraceReading, AnUnfinishedCallEndsWithItsThreadsLastRecord) {
  const std::string context = bytesOf(50) + bytesOf(51);
  const std::string other = bytesOf(50) + bytesOf(52);
  make("t", metadataWith("number32 vpid; number32 vtid;"),
       {packet(enter(100, context) + enter(150, other) + leave(200, context, kIsDirectory) +
               enter(300, other, kIsDirectory) + leave(310, other, kIsDirectory))});
  std::vector<Json> unfinished;
  for (const Json& call : lines()) {
    if (call["finished"] == false) unfinished.push_back(call);
  }
  ASSERT_EQ(unfinished.size(), 2U);
  EXPECT_EQ(unfinished[0]["end"], 200);
  EXPECT_EQ(unfinished[1]["end"], 310);

  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile).message(150, kCopyFile + 1, "")});
  EXPECT_EQ(lines().back()["end"], 150);
}

TEST_F(TraceReading, ACallMayBeInSeveralPackets) {
  makeTrace(temp.path("t"), {MadeStream(70)
                                 .enter(100, kCopyFile)
                                 .endPacket()
                                 .enter(150, kIsDirectory)
                                 .leave(160, kIsDirectory, 1)
                                 .endPacket()
                                 .leave(200, kCopyFile, 1)});
  const std::vector<Json> calls = lines();
  ASSERT_EQ(calls.size(), 2U);
  EXPECT_EQ(calls[0]["depth"], 1);
  EXPECT_EQ(calls[1]["begin"], 100);
  EXPECT_EQ(calls[1]["end"], 200);
}

// ---- Other fields ----

TEST_F(TraceReading, ATextMayBeAString) {
  const std::string text = replaced(kMadeMetadata,
                                    "number64 object; number32 length;\n"
                                    "    integer { size = 8; align = 8; encoding = UTF8; } "
                                    "text[length];",
                                    "number64 object; string text;");
  const auto message = [](uint64_t time, const std::string& what) {
    return event(2, time, "", {trace::kDebug, kCopyFile + 1, 0}) + what + '\0';
  };
  make("t", replaced(text, " number64 events_discarded; number64 tid;", ""),
       {packet(message(100, "first text") + message(200, "second"))});
  const std::vector<Json> messages = lines();
  ASSERT_EQ(messages.size(), 2U);
  EXPECT_EQ(messages[0]["text"], "first text");
  EXPECT_EQ(messages[1]["text"], "second");
}

TEST_F(TraceReading, EventsWithOtherFieldsAreNotThoseOfFunctions) {
  struct Case {
    std::string fields;
    std::string bytes;
  };
  const std::string debug = bytesOf(trace::kDebug);
  const std::string function = bytesOf(kCopyFile);
  const Case cases[] = {
      {"number64 type;", debug},
      {"number64 function;", function},
      {"number64 type; string function; string text;", debug + "x" + '\0' + "y" + '\0'},
      {"string type; number64 function; string text;", std::string("x") + '\0' + function + '\0'},
      {"number64 type; number64 function;", debug + function},
      {"number64 type; number64 function; number64 text;", debug + function + bytesOf(uint64_t{5})},
      {"number64 type; number64 function; struct { number64 a; } text[1];",
       debug + function + bytesOf(uint64_t{5})},
      {"number64 type; number64 function; string text;",
       bytesOf(uint64_t{1}) + function + std::string("x\0", 2)},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.fields);
    const std::string call = enter(100, "") + leave(200, "");
    make("t",
         metadataWith("") + "event { name = \"more\"; id = 4; stream_id = 0; fields := struct { " +
             one.fields + " }; };\n",
         {packet(call + event(4, 300, "", {}) + one.bytes)});
    const Result result = run({"summary", "--json"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "osutils: trace summary: 1 event not of traced functions left out\n");
    const Json answer = Json::parse(result.out);
    EXPECT_EQ(answer["foreign"], 1);
    EXPECT_EQ(answer["records"], 2);
  }
}

TEST_F(TraceReading, EventsWithoutAClockAreNotThoseOfFunctions) {
  std::string metadata = replaced(metadataWith(""), " map = clock.real.value;", "");
  const size_t begin = metadata.find("clock {");
  metadata.erase(begin, metadata.find("};\n", begin) + 3 - begin);
  // A reader makes a clock for fields of this name.
  while (metadata.find("timestamp") != std::string::npos) {
    metadata = replaced(metadata, "timestamp", "moment");
  }
  make("t", metadata, {packet(enter(100, "") + leave(200, ""))});
  const Result result = run({"summary"});
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.err,
            "osutils: trace summary: 2 events not of traced functions left out: no others\n");
}

TEST_F(TraceReading, PacketsMayHaveNoContext) {
  std::string metadata = metadataWith("");
  const size_t begin = metadata.find("  packet.context");
  metadata.erase(begin, metadata.find("};\n", begin) + 3 - begin);
  const std::string header =
      bytesOf(uint32_t{0xC1FC1FC1}) + bytesOf(uint32_t{0}) + bytesOf(uint64_t{0});
  make("t", metadata, {header + enter(100, "") + leave(200, "")});
  if (run({"summary"}).err.find("without-default-clock-snapshot") != std::string::npos) {
    GTEST_SKIP() << "libbabeltrace2 2.1.1 aborts over them";
  }
  const std::vector<Json> calls = lines();
  ASSERT_EQ(calls.size(), 1U);
  EXPECT_EQ(calls[0]["end"], 200);
}

TEST_F(TraceReading, FoldersMayHaveDifferentLayouts) {
  const std::string swapped = replaced(kMadeMetadata, "number64 type; number64 function;",
                                       "number64 function; number64 type;");
  for (int i = 0; i < 20; ++i) {
    const std::string folder = temp.path("t/" + std::to_string(i));
    if (i % 2 == 0) {
      makeTrace(folder, {MadeStream(70).enter(100, kCopyFile)});
    } else {
      std::string bytes = MadeStream(70).enter(100, kCopyFile).file();
      const std::string fields = bytesOf(trace::kEntry33) + bytesOf(kCopyFile);
      make("t/" + std::to_string(i), swapped,
           {replaced(bytes, fields, bytesOf(kCopyFile) + bytesOf(trace::kEntry33))});
    }
  }
  const std::vector<Json> calls = lines();
  EXPECT_EQ(calls.size(), 20U);
  for (const Json& call : calls) EXPECT_EQ(call["function"], "copyFile");
}

// The number of events is bounded by the size of the files.
TEST_F(TraceReading, AnEventMayHaveASingleBit) {
  constexpr uint64_t kBytes = 1000;
  const uint64_t bits = 8 * (4 + 16 + kBytes);
  make("t",
       "/* CTF 1.8 */\n"
       "typealias integer { size = 32; align = 8; } := number32;\n"
       "typealias integer { size = 64; align = 8; } := number64;\n"
       "trace { major = 1; minor = 8; byte_order = le;\n"
       "  packet.header := struct { number32 magic; }; };\n"
       "stream { packet.context := struct { number64 content_size; number64 packet_size; };\n"
       "  event.header := struct { integer { size = 1; align = 1; } id; }; };\n"
       "event { name = \"bit\"; id = 0; fields := struct { }; };\n",
       {bytesOf(uint32_t{0xC1FC1FC1}) + bytesOf(bits) + bytesOf(bits) + std::string(kBytes, '\0')});
  EXPECT_EQ(run({"summary"}).err,
            "osutils: trace summary: 8000 events not of traced functions left out: no others\n");
}

// ---- What is released ----

// A trace of this many threads, with no more descriptors than a few files need.
TEST_F(TraceReading, NoDescriptorIsKeptForAThread) {
  std::vector<MadeStream> streams;
  for (uint64_t thread = 0; thread < 100; ++thread) {
    streams.push_back(MadeStream(70 + thread).enter(100, kCopyFile).leave(200, kCopyFile, 1));
  }
  makeTrace(temp.path("t"), streams);
  const Result result = osutils({"trace", "summary", "--json", temp.path("t")}, [] {
    const rlimit few = {32, 32};
    if (setrlimit(RLIMIT_NOFILE, &few) != 0) _exit(126);
  });
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(Json::parse(result.out)["records"], 200);
}

// Of as many unfinished calls as exits without an entry.
TEST_F(TraceReading, AnExitWithoutAnEntryIsNotLookedForInEveryOpenCall) {
  constexpr uint64_t kCalls = 200'000;
  MadeStream stream(70);
  for (uint64_t i = 1; i <= kCalls; ++i) stream.enter(i, kCopyFile);
  for (uint64_t i = 1; i <= kCalls; ++i) stream.leave(kCalls + i, kIsDirectory, 1);
  makeTrace(temp.path("t"), {stream.leave(3 * kCalls, kCopyFile, 1)});
  const Result result = osutils({"trace", "summary", "--json", temp.path("t")}, [] {
    const rlimit seconds = {20, 20};  // many times the need, and less than all pairs take
    if (setrlimit(RLIMIT_CPU, &seconds) != 0) _exit(126);
  });
  ASSERT_EQ(result.status, 0) << result.err;
  const Json answer = Json::parse(result.out);
  for (const Json& row : answer["functions"]) {
    EXPECT_EQ(row["calls"], kCalls);
    EXPECT_EQ(row["unfinished"], row["function"] == "copyFile" ? kCalls - 1 : 0);
  }
}

#ifndef SANITIZER_OWNS_MALLOC
TEST_F(TraceReading, MemoryDoesNotGrowWithTheFolders) {
  const auto peak = [&](int folders) {
    for (int i = 0; i < folders; ++i) {
      makeTrace(temp.path("t/" + std::to_string(i)),
                {MadeStream(70).enter(100, kCopyFile).leave(200, kCopyFile, 1)});
    }
    const std::string path = temp.path("t");
    const pid_t child = fork();
    if (child == 0) {
      const int null = open("/dev/null", O_WRONLY);
      dup2(null, STDOUT_FILENO);
      execl(OSUTILS_TOOL, OSUTILS_TOOL, "trace", "summary", path.c_str(), nullptr);
      _exit(126);
    }
    int status = -1;
    rusage usage = {};
    EXPECT_EQ(wait4(child, &status, 0, &usage), child);
    EXPECT_EQ(status, 0);
    return usage.ru_maxrss;  // KiB
  };
  const long few = peak(20);
  EXPECT_LT(peak(420), few + 8'192);
}
#endif

// ---- What cannot be read ----

TEST_F(TraceReading, WhatLibbabeltrace2SaysIsShown) {
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile)});
  writeFile(temp.path("t/metadata"), "1234");
  Result result = run({"summary", "--json"});
  EXPECT_EQ(result.status, 3);
  const std::string line = "osutils: trace summary: " + temp.path("t") + ": ";
  EXPECT_THAT(result.err,
              AllOf(::testing::StartsWith(line), Not(HasSubstr("libbabeltrace2 failed")),
                    Not(HasSubstr("cannot read the file"))));
  EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
  EXPECT_EQ(Json::parse(result.out)["unreadable"], 1);

  writeFile(temp.path("t/metadata"), "123");
  result = run({"summary", "--json"});
  EXPECT_EQ(result.err, line + "cannot read the file metadata\n");
  EXPECT_EQ(Json::parse(result.out)["unreadable"], 1);
}

TEST_F(TraceReading, APathWithoutATraceCounts) {
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile)});
  const Result result = run({"summary", "--json", temp.path("none")});
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(Json::parse(result.out)["unreadable"], 1);
}

TEST_F(TraceReading, WithoutThePluginsOfLibbabeltrace2OneLineSaysSo) {
  REQUIRE_ROOT("to hide the plugins behind a mount");
  std::string plugins;
  for (const auto& entry : std::filesystem::directory_iterator("/usr/lib")) {
    const std::filesystem::path path = entry.path() / "babeltrace2/plugins";
    if (std::filesystem::is_directory(path)) plugins = path;
  }
  if (plugins.empty()) GTEST_SKIP() << "the plugins are not below /usr/lib";
  makeTrace(temp.path("t"), {MadeStream(70).enter(100, kCopyFile)});
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("tmpfs", plugins.c_str(), "tmpfs", 0, nullptr), 0);
              expectFailure(run({"summary"}),
                            "osutils: other (80): cannot load libbabeltrace2's plugin \"ctf\": "
                            "libbabeltrace2 failed\n");
              return 0;
            }),
            0);
}

}  // namespace
