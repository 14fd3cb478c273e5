// What the tool prints: tables, JSON and the library's debug messages; and the exit status of every
// command.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

class Output : public ::testing::Test {
 protected:
  const TempDir temp;
  const std::string services = temp.file("services", "ssh 22/tcp\n");
};

// ---- Columns ----

TEST_F(Output, ColumnsLineUpAsATerminalShowsThem) {
  struct Case {
    std::string text;
    size_t width;
  };
  const Case cases[] = {
      {"\303\244\303\266\303\274", 3},  // letters of two bytes
      {"\346\274\242\345\255\227", 4},  // wide ideographs
      {"e\314\201", 1},                 // a letter and a combining accent
      {"\360\237\230\200", 2},          // wide, beyond 16 bits
      {"\377\200", 2},                  // invalid bytes
      {"a\302\233b", 3},                // a control character of two bytes, shown as ?
      {"\342\200\213x", 1},             // a zero-width space
  };
  for (const char* const locale : {"C", "C.UTF-8", "POSIX"}) {
    for (const Case& each : cases) {
      SCOPED_TRACE(each.text + " in " + locale);
      const Result result =
          osutils({"name", "check", each.text + "12345678"}, [&] { setenv("LC_ALL", locale, 1); });
      std::string shown = each.text;
      if (shown == "a\302\233b") shown = "a?b";
      EXPECT_EQ(result.out, "NAME" + std::string(each.width + 6, ' ') + "VALID\n" + shown +
                                "12345678  false\n");
    }
  }
}

TEST_F(Output, ControlCharactersAndNoOthersAreShownAsQuestionMarks) {
  const auto shown = [](const std::string& text) {
    std::string out = osutils({"name", "check", "xx" + text + "xx"}).out;
    out.erase(0, out.find('\n') + 1);
    return out.substr(2, out.rfind("xx  false") - 2);
  };
  for (int byte = 1; byte < ' '; ++byte)
    EXPECT_EQ(shown(std::string(1, static_cast<char>(byte))), "?");
  EXPECT_EQ(shown(" ~\177\302\200\302\237\302\240\302\241"), " ~???\302\240\302\241");
  EXPECT_EQ(shown("\302\177"), "\302?");  // not a character of two bytes
  EXPECT_EQ(shown("\302"), "\302");
}

TEST_F(Output, AnswersDoNotDependOnTheLocale) {
  for (const char* const locale : {"C", "C.UTF-8"}) {
    const Result result =
        osutils({"dn", "format", "--json", "cn=\303\244"}, [&] { setenv("LC_ALL", locale, 1); });
    EXPECT_EQ(result.out, "{\"name\":\"cn=\303\244\",\"formatted\":\"CN=\303\244\"}\n");
  }
}

// ---- The library's debug messages ----

TEST_F(Output, VerbosePrintsTheDebugMessagesWithTheTextOfTheErrorNumber) {
  const std::string path = temp.path("missing/new");
  for (const Arguments& typed : {Arguments{"--verbose", "file", "create", path},
                                 Arguments{"file", "--verbose", "create", path},
                                 Arguments{"file", "create", "--verbose", path}}) {
    const Result result = osutils(typed);
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(result.out, "");
    EXPECT_THAT(result.err,
                HasSubstr("\ncreateFile: open - errno =2 (No such file or directory)\n"));
    EXPECT_THAT(result.err, HasSubstr("\nosutils: file create: "));
  }
  EXPECT_THAT(osutils({"file", "create", path}).err, StartsWith("osutils: "));
}

TEST_F(Output, VerboseSaysThatAFileWasRefused) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     const Result result = osutils(
                         {"--verbose", "file", "create", temp.path("new")}, dropCoverageCounters);
                     EXPECT_EQ(result.status, 3);
                     EXPECT_THAT(result.err, HasSubstr("open - errno =13 (Permission denied)\n"));
                     return ::testing::Test::HasFailure() ? 1 : 0;
                   }),
            0);
}

TEST_F(Output, VerboseLeavesTheAnswerAsItIs) {
  const Result result = osutils({"--verbose", "file", "stat", "--json", temp.path("missing")});
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.out, osutils({"file", "stat", "--json", temp.path("missing")}).out);
  EXPECT_THAT(result.err, StartsWith("doesFileExist: "));
}

TEST_F(Output, VerboseDoesNotReplaceThePlatformsDebugPrint) {
  const std::string log = temp.path("log");
  const auto debug = [&] {
    setenv("PRINT_DEBUG", "all", 1);
    setenv("PRINT_DEBUG_FILE", log.c_str(), 1);
  };
  EXPECT_THAT(osutils({"--verbose", "file", "stat", temp.path("missing")}, debug).err,
              StartsWith("doesFileExist: "));
  EXPECT_THAT(contentsOf(log), HasSubstr(" doesFileExist: "));
}

// The debug messages that name an error number.
TEST_F(Output, VerboseExplainsEachErrorNumberOnce) {
  const std::string missing = temp.path("missing");
  EXPECT_EQ(osutils({"--verbose", "file", "check", missing}).err,
            "doesFileExist: stat() - errno=2 (No such file or directory)\n"
            "canAccessFile: stat() - errno=2 (No such file or directory)\n"
            "checkFilePerms - The file " +
                missing +
                " does not exist.\n"
                "osutils: file check: no such object (32): " +
                missing + "\n");
  EXPECT_THAT(osutils({"--verbose", "file", "stat", temp.file("plain", "") + "/below"}).err,
              HasSubstr("stat() - errno=20 (Not a directory)\n"));
}

TEST_F(Output, VerboseLeavesAnExplainedErrorNumberAsItIs) {
  EXPECT_THAT(osutils({"--verbose", "file", "clear", temp.path("missing/below")}).err,
              HasSubstr("truncate file. errno=2 - No such file or directory\n"));
}

std::string recordsIn(const std::string& trace) {
  return runProgram({"/usr/bin/env", "babeltrace2", trace}).out;
}

TEST_F(Output, VerboseAddsNothingToATrace) {
  if (runProgram({"/usr/bin/env", "babeltrace2", "--version"}).status != 0) {
    GTEST_SKIP() << "babeltrace2 is not installed";
  }
  const auto traced = [&](const std::string& events, const std::string& name) {
    const std::string trace = temp.path(name);
    const Result result =
        osutils({"--verbose", "--trace", trace, "file", "stat", temp.path("missing")},
                [&] { setenv("TRC_EVENTS", events.c_str(), 1); });
    EXPECT_EQ(result.status, 0);
    EXPECT_THAT(result.err, HasSubstr("doesFileExist: stat() - errno=2 (No such"));
    return recordsIn(trace);
  };
  EXPECT_THAT(traced("entry", "a"), AllOf(HasSubstr("\"entry\""), Not(HasSubstr("\"debug\""))));
  EXPECT_THAT(traced("entry,debug", "b"),
              AllOf(HasSubstr("\"entry\""), HasSubstr("\"debug\""), HasSubstr("stat() - errno=2")));
}

TEST_F(Output, NamesABadTraceSetting) {
  struct Case {
    std::string setting;
    std::string value;
    std::string reason;
  };
  const Case cases[] = {
      {"TRC_EVENTS", "entry,bogus", "cannot start tracing: TRC_EVENTS is \"entry,bogus\"\n"},
      {"TRC_MAX_BYTES", "much", "cannot start tracing: TRC_MAX_BYTES is \"much\"\n"},
      {"TRC_MODE", "last", "cannot start tracing: TRC_MODE is \"last\"\n"},
  };
  for (const Case& each : cases) {
    for (const std::string& trace : {temp.path("trace"), std::string("/dev/null/trace")}) {
      SCOPED_TRACE(each.setting + trace);
      expectFailure(osutils({"--trace", trace, "platform"},
                            [&] { setenv(each.setting.c_str(), each.value.c_str(), 1); }),
                    "osutils: platform: operations error (1): " + each.reason);
    }
  }
  expectFailure(
      osutils({"--trace", "/dev/null/trace", "platform"}),
      "osutils: platform: operations error (1): cannot start tracing in /dev/null/trace\n");
}

// ---- Exit statuses ----

struct Command {
  Arguments words;
  Arguments good;  // succeeds
  bool is_question = false;
  Arguments bad;  // fails, or answers no
};

TEST_F(Output, EveryCommandEndsWithTheStatusOfItsKind) {
  const std::string here = temp.path();
  const std::string missing = temp.path("missing");
  const std::string inittab = temp.file("inittab", "id:2:initdefault:x\n");
  const std::string etc = temp.dir("etc");
  writeFile(temp.file("etc/ldapdb.properties", ""),
            "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=9.1\n");
  temp.file("vrarun", "#!/bin/sh\n[ $1 = good ]\n");
  ASSERT_EQ(chmod(temp.path("vrarun").c_str(), 0755), 0);
  const Command commands[] = {
      {{"help"}, {"file"}, false, {}},
      {{"services", "list"}, {"--file", services}, false, {"--file", missing}},
      {{"services", "add"},
       {"--file", services, "a", "1"},
       false,
       {"--file", services, "ssh", "2"}},
      {{"services", "delete"}, {"--file", services, "a"}, false, {"--file", services, "a"}},
      {{"services", "port"}, {"--file", services, "ssh"}, false, {"--file", services, "a"}},
      {{"services", "free-port"}, {"--file", services}, false, {"--file", missing}},
      {{"inittab", "list"}, {"--file", inittab}, false, {"--file", missing}},
      {{"inittab", "add"},
       {"--file", inittab, "a", "2", "wait", "x"},
       false,
       {"--file", inittab, "id", "2", "wait", "x"}},
      {{"inittab", "delete"}, {"--file", inittab, "a"}, false, {"--file", inittab, "a"}},
      {{"inittab", "find"}, {"--file", inittab, "x"}, false, {"--file", inittab, "y"}},
      {{"inittab", "free-id"}, {"--file", inittab}, false, {"--file", missing}},
      {{"paths"}, {}, false, {}},
      {{"db"}, {}, false, {"--migration", missing}},
      {{"file", "stat"}, {here}, false, {}},
      {{"file", "check"}, {services}, false, {here}},
      {{"file", "copy"}, {services, temp.path("copy")}, false, {missing, temp.path("copy")}},
      {{"file", "create"}, {temp.path("new")}, false, {temp.path("new")}},
      {{"file", "owner"}, {temp.path("new")}, false, {missing}},
      {{"file", "clear"}, {temp.path("new")}, false, {here}},
      {{"file", "delete"}, {temp.path("new")}, false, {missing}},
      {{"dir", "create"}, {temp.path("made")}, false, {here}},
      {{"dir", "delete"}, {temp.path("made")}, false, {missing}},
      {{"dir", "trim"}, {here}, false, {}},
      {{"space"}, {"1", here}, true, {"99999999999999", here}},
      {{"user", "exists"}, {"root"}, true, {"no-such-one"}},
      {{"user", "home"}, {"root"}, false, {"no-such-one"}},
      {{"user", "group"}, {"root"}, false, {"no-such-one"}},
      {{"user", "valid"}, {}, false, {"no-such-one"}},
      {{"group", "exists"}, {"root"}, true, {"no-such-one"}},
      {{"group", "members"}, {"root"}, false, {"no-such-one"}},
      {{"group", "has"}, {"root", "root"}, true, {"root", "nobody"}},
      {{"name", "check"}, {"inst1"}, true, {"1inst"}},
      {{"screen"}, {"a"}, true, {";"}},
      {{"time"}, {}, false, {}},
      {{"process", "start"},
       {"--launcher-dir", here, "good"},
       false,
       {"--launcher-dir", here, "x"}},
      {{"process", "stop"}, {}, false, {"2147483647"}},
      {{"process", "status"}, {}, true, {"2147483647", "no-such-one"}},
      {{"platform"}, {}, false, {}},
      {{"module", "check"}, {"libc.so.6"}, false, {missing}},
      {{"net", "addresses"}, {"--localhost"}, false, {}},
      {{"net", "resolve"}, {"localhost"}, false, {""}},
      {{"dn", "format"}, {"a=b"}, false, {}},
      {{"dn", "compare"}, {"a=b", "A=B"}, true, {"a=b", "a=c"}},
  };
  const auto run = [&](const Command& command, const Arguments& rest) {
    Arguments typed = command.words;
    typed.insert(typed.end(), rest.begin(), rest.end());
    SCOPED_TRACE(::testing::PrintToString(typed));
    return osutils(typed, [&] { setenv("VRA_LDAP_HOME", here.c_str(), 1); }).status;
  };
  for (const Command& command : commands) {
    SCOPED_TRACE(::testing::PrintToString(command.words));
    const bool takes_none = command.words.size() == 1 && command.good.empty();
    if (!command.good.empty() || takes_none) {
      EXPECT_EQ(run(command, command.good), 0);
    }
    if (!command.bad.empty()) {
      EXPECT_EQ(run(command, command.bad), command.is_question ? 1 : 3);
    }
    EXPECT_EQ(run(command, {"--no-such-option"}), 2);
    Arguments help = command.words;
    help.insert(help.begin(), "help");
    EXPECT_THAT(
        osutils(help).out,
        HasSubstr(command.is_question
                      ? "The exit status is 0 for yes, 1 for no, 2 for wrong usage and 3 after "
                        "a failure."
                      : "The exit status is 0 after success, 2 for wrong usage and 3 after a "
                        "failure."));
  }
}

// ---- Tables and JSON ----

std::vector<std::string> cellsOf(const std::string& line) {
  std::vector<std::string> cells;
  for (size_t at = 0; at < line.size();) {
    const size_t end = std::min(line.find("  ", at), line.size());
    cells.push_back(line.substr(at, end - at));
    at = std::min(line.find_first_not_of(' ', end), line.size());
  }
  return cells;
}

TEST_F(Layout, TheTableSaysTheSameAsTheJson) {
  writeFile(etc + "/ldapdb.properties", "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=9.1\n");
  const std::string other = temp.file("other", "");
  const std::string inittab = temp.file("inittab", "id:2:wait:/bin/a b\nl0:0:off:/c\n");
  const std::vector<Arguments> commands = {
      {"services", "list", "--file", file},
      {"paths"},
      {"db"},
      {"file", "stat", file},
      {"file", "check", file},
      {"file", "copy", file, other},
      {"file", "create", "--force", other},
      {"file", "owner", file},
      {"file", "clear", other},
      {"dir", "trim", "/usr/lib"},
      {"space", "0", root},
      {"user", "exists", "root"},
      {"user", "exists", "no-such-one"},
      {"user", "home", "root"},
      {"user", "group", "root"},
      {"group", "exists", "root"},
      {"group", "has", "root", "root"},
      {"name", "check", "inst1"},
      {"screen", "a", "b c"},
      {"inittab", "list", "--file", inittab},
      {"inittab", "find", "--file", inittab, "b"},
      {"inittab", "free-id", "--file", inittab},
      {"process", "status", "1", "no-such-one"},
      {"platform"},
      {"module", "check", "libc.so.6", "malloc"},
      {"net", "addresses", "--localhost"},
      {"dn", "format", "a = b"},
      {"dn", "compare", "a = b", "A=B"},
  };
  for (const Arguments& command : commands) {
    SCOPED_TRACE(::testing::PrintToString(command));
    Arguments with_json = command;
    with_json.insert(with_json.begin(), "--json");
    const Result table = atRoot(command);
    const Result json = atRoot(with_json);
    EXPECT_EQ(table.status, json.status);
    nlohmann::ordered_json answer = nlohmann::ordered_json::parse(json.out);
    if (answer.is_object()) answer = nlohmann::ordered_json::array({answer});

    std::istringstream lines(table.out);
    std::string line;
    std::getline(lines, line);
    const std::vector<std::string> headings = cellsOf(line);
    for (const auto& object : answer) {
      ASSERT_TRUE(std::getline(lines, line));
      const std::vector<std::string> cells = cellsOf(line);
      ASSERT_EQ(cells.size(), object.size());
      ASSERT_EQ(headings.size(), object.size());
      size_t column = 0;
      for (const auto& [key, value] : object.items()) {
        std::string heading = key;
        std::transform(heading.begin(), heading.end(), heading.begin(),
                       [](char c) { return static_cast<char>(c - 'a' + 'A'); });
        EXPECT_EQ(headings[column], heading);
        EXPECT_EQ(cells[column], value.is_string() ? value.get<std::string>() : value.dump());
        ++column;
      }
    }
    EXPECT_FALSE(std::getline(lines, line)) << line;
  }
}

// ---- Standard streams ----

// No file takes the place of a stream that is closed.
TEST_F(Tool, WorksWithoutStandardStreams) {
  for (int closed = 1; closed < 8; ++closed) {
    SCOPED_TRACE(closed);
    writeFile(file, kServices);
    const Result result = services({"delete", "--verbose", "domain"}, [closed] {
      for (int stream = 0; stream <= STDERR_FILENO; ++stream) {
        if ((closed & 1 << stream) != 0) close(stream);
      }
    });
    EXPECT_EQ(result.status, (closed & 2) != 0 ? 3 : 0);
    EXPECT_EQ(result.out, (closed & 2) != 0 ? "" : "DELETED\ndomain\n");
    EXPECT_EQ(result.err.empty(), (closed & 4) != 0);
    EXPECT_EQ(contentsOf(file),
              "# services of the test\nssh\t22/tcp\t# remote shell\nldap    389/tcp  directory\n");
    const std::string lock = contentsOf(file + ".lock");
    EXPECT_EQ(std::count(lock.begin(), lock.end(), '\n'), 1) << lock;
  }
}

// ---- Standard output ----

void useAsStandardOutput(const char* path) {
  dup2(open(path, O_WRONLY | O_CLOEXEC), STDOUT_FILENO);
}

TEST_F(Tool, ReportsAnAnswerThatCouldNotBeWritten) {
  const auto full = [] { useAsStandardOutput("/dev/full"); };
  const auto closed = [] { close(STDOUT_FILENO); };
  const auto without_reader = [] {
    int ends[2];
    if (pipe(ends) != 0) _exit(125);
    dup2(ends[1], STDOUT_FILENO);
    close(ends[0]);
    close(ends[1]);
  };
  const std::string output = "operations error (1): cannot write to standard output: ";

  expectFailure(services({"list"}, full),
                "osutils: services list: " + output + "No space left on device\n");
  expectFailure(services({"list", "--json"}, closed),
                "osutils: services list: " + output + "Bad file descriptor\n");
  expectFailure(services({"free-port"}, without_reader),
                "osutils: services free-port: " + output + "Broken pipe\n");
  expectFailure(osutils({"--help"}, full), "osutils: " + output + "No space left on device\n");
  expectFailure(osutils({"--version"}, closed), "osutils: " + output + "Bad file descriptor\n");

  writeFile(file, std::string(kServices) + std::string(100'000, '#') + "\n");
  expectFailure(services({"add", "--dry-run", "vraslapd", "3700"}, closed),
                "osutils: services add: " + output + "Bad file descriptor\n");
  expectFailure(
      services({"add", "vraslapd", "3700"}, closed),
      "osutils: services add: " + output + "Bad file descriptor; the change itself is done\n");
  EXPECT_THAT(contentsOf(file), AllOf(StartsWith(kServices), EndsWith("#\nvraslapd\t3700/tcp\n")));
}

}  // namespace
