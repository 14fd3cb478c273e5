// The command-line tool, run as a child process on scratch files.
#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "process_namespace.h"
#include "system_call_filter.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// ---- Answers ----

TEST_F(Tool, ListsTheServicesInTheOrderOfTheFile) {
  expectAnswer(services({"list"}),
               "NAME    PORT\n"
               "ssh     22\n"
               "domain  53\n"
               "domain  53\n"
               "ldap    389\n");
  expectAnswer(services({"list", "--json"}),
               R"([{"name":"ssh","port":22},{"name":"domain","port":53},)"
               R"({"name":"domain","port":53},{"name":"ldap","port":389}])"
               "\n");
}

TEST_F(Tool, ListsNothingOfAFileWithoutServices) {
  for (const char* contents :
       {"", "\n", "# ssh 22/tcp\n", "ssh\n", "ssh tcp/22\n", "22 22/tcp\n"}) {
    SCOPED_TRACE(contents);
    writeFile(file, contents);
    expectAnswer(services({"list"}), "");
    expectAnswer(services({"list", "--json"}), "[]\n");
  }
}

TEST_F(Tool, ListBeginsWithTheFirstLineThatIsAService) {
  writeFile(file, "later\nlater udp\n  \t first 1/tcp\nlater 2/tcp");
  expectAnswer(services({"list"}), "NAME   PORT\nfirst  1\nlater  2\n");
}

TEST_F(Tool, ListTakesThePiecesOfALongLineForLines) {
  writeFile(file, "#" + std::string(1022, '-') + "piece 7/tcp\nnext 8/tcp\n");
  expectAnswer(services({"list"}), "NAME   PORT\npiece  7\nnext   8\n");
}

TEST_F(Tool, ListCutsALongName) {
  writeFile(file, std::string(95, 'a') + " 7/tcp\n");
  expectAnswer(services({"list", "--json"}),
               R"([{"name":")" + std::string(90, 'a') + R"(","port":7}])" + "\n");
}

TEST_F(Tool, ShowsNoControlCharactersAndOnlyValidJson) {
  writeFile(file, "a\033[2J 7/tcp\nb\377 8/tcp\n");
  expectAnswer(services({"list"}), "NAME   PORT\na?[2J  7\nb\377     8\n");
  expectAnswer(services({"list", "--json"}), R"([{"name":"a\u001b[2J","port":7},{"name":"b)"
                                             "\357\277\275"
                                             R"(","port":8}])"
                                             "\n");
}

TEST_F(Tool, AddAppendsTheLineAndShowsIt) {
  expectAnswer(services({"add", "vraslapd", "3700"}), "NAME      PORT\nvraslapd  3700\n");
  expectAnswer(services({"add", "--json", "other", "65535"}), R"({"name":"other","port":65535})"
                                                              "\n");

  EXPECT_EQ(contentsOf(file), std::string(kServices) + "vraslapd\t3700/tcp\nother\t65535/tcp\n");
}

TEST_F(Tool, AddsToAnEmptyFile) {
  writeFile(file, "");
  expectAnswer(services({"add", "vraslapd", "1"}), "NAME      PORT\nvraslapd  1\n");
  EXPECT_EQ(contentsOf(file), "vraslapd\t1/tcp\n");
}

TEST_F(Tool, AddsANameOfNinetyCharacters) {
  const std::string name(90, 'n');
  expectAnswer(services({"add", name, "3700"}),
               "NAME" + std::string(88, ' ') + "PORT\n" + name + "  3700\n");
  expectAnswer(services({"port", "--json", name}),
               R"({"name":")" + name + R"(","port":3700})" + "\n");
}

TEST_F(Tool, DeleteRemovesEveryLineOfTheServiceAndLeavesNoBackup) {
  expectAnswer(services({"delete", "domain"}), "DELETED\ndomain\n");
  EXPECT_EQ(contentsOf(file),
            "# services of the test\nssh\t22/tcp\t# remote shell\nldap    389/tcp  directory\n");

  expectAnswer(services({"delete", "--json", "ssh"}), R"({"deleted":"ssh"})"
                                                      "\n");
  EXPECT_EQ(contentsOf(file), "# services of the test\nldap    389/tcp  directory\n");
  EXPECT_FALSE(pathExists(file + ".vrasave"));
}

TEST_F(Tool, DeleteKeepsItsCopyAtTheBackupPath) {
  const std::string elsewhere = temp.dir("elsewhere");
  const std::string blocked = temp.dir("services.vrasave");  // the default path cannot be used

  expectFailure(services({"delete", "ldap"}),
                "osutils: services delete: unwilling to perform (53): the backup path " + blocked +
                    " is taken by a directory\n");
  expectAnswer(services({"delete", "--backup", elsewhere + "/copy", "ldap"}), "DELETED\nldap\n");

  EXPECT_FALSE(pathExists(elsewhere + "/copy"));
  EXPECT_TRUE(pathExists(blocked));
}

TEST_F(Tool, ShowsThePortOfAService) {
  expectAnswer(services({"port", "ldap"}), "NAME  PORT\nldap  389\n");
  expectAnswer(services({"port", "--json", "domain"}), R"({"name":"domain","port":53})"
                                                       "\n");
}

TEST_F(Tool, AcceptsTheNamesOfCommandsAsServices) {
  for (const std::string name : {"services", "list", "add", "delete", "port"}) {
    SCOPED_TRACE(name);
    expectAnswer(services({"add", "--json", name, "5000"}),
                 R"({"name":")" + name + R"(","port":5000})" + "\n");
    expectAnswer(services({"port", name}),
                 "NAME" + std::string(std::max(name.size(), size_t{4}) - 2, ' ') + "PORT\n" + name +
                     std::string(name.size() < 4 ? 3 : 2, ' ') + "5000\n");
    expectAnswer(services({"delete", name}), "DELETED\n" + name + "\n");
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, FindsAFreePort) {
  expectAnswer(services({"free-port"}), "PORT\n3700\n");
  expectAnswer(services({"free-port", "53"}), "PORT\n54\n");
  expectAnswer(services({"free-port", "--json", "0"}), "{\"port\":1}\n");
  expectAnswer(services({"free-port", "65535"}), "PORT\n65535\n");
  writeFile(file, "a 3700/tcp\nb 3701/udp\n");
  expectAnswer(services({"free-port"}), "PORT\n3702\n");
}

TEST_F(Tool, WorksOnTheSystemsFileByDefault) {
  REQUIRE_ROOT("to put another file in the place of /etc/services");
  EXPECT_EQ(withPrivateEtc([] {
              writeFile("/etc/services", kServices);
              expectAnswer(osutils({"services", "add", "vraslapd", "3700"}),
                           "NAME      PORT\nvraslapd  3700\n");
              expectAnswer(osutils({"services", "port", "--json", "vraslapd"}),
                           "{\"name\":\"vraslapd\",\"port\":3700}\n");
              expectAnswer(osutils({"services", "delete", "vraslapd"}), "DELETED\nvraslapd\n");
              EXPECT_EQ(contentsOf("/etc/services"), kServices);
              EXPECT_FALSE(pathExists("/etc/services.vrasave"));
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST_F(Tool, ExplainsItself) {
  expectAnswer(osutils({"--version"}), "osutils " OSUTILS_VERSION "\n");
  const Result help = osutils({"--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_THAT(help.out, AllOf(HasSubstr("services"), HasSubstr("--version")));
  EXPECT_EQ(help.err, "");
  const std::vector<std::string> commands = {"list", "add", "delete", "port", "free-port"};
  for (const std::string& command : commands) {
    SCOPED_TRACE(command);
    const Result text = osutils({"services", command, "--help"});
    EXPECT_EQ(text.status, 0);
    EXPECT_THAT(text.out, AllOf(HasSubstr("--file"), HasSubstr("--backup"), HasSubstr("--json"),
                                HasSubstr("--trace")));
    EXPECT_EQ(text.err, "");
  }
  EXPECT_THAT(osutils({"services", "delete", "--help"}).out, HasSubstr("rewritten in place"));
}

// ---- Failures ----

TEST_F(Tool, EveryCommandReportsAFileThatCannotBeLoaded) {
  struct Case {
    std::string path;
    std::string result;
  };
  const std::string fifo = temp.path("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  const std::string link = temp.path("link");
  ASSERT_EQ(symlink("nowhere", link.c_str()), 0);
  const std::string directory = temp.dir("directory");
  const Case cases[] = {
      {temp.path("missing"), "no such object (32): cannot read " + temp.path("missing")},
      {link, "no such object (32): cannot read " + link},
      {"", "no such object (32): cannot read "},
      {directory, "constraint violation (19): cannot read " + directory},
      {fifo, "unwilling to perform (53): " + fifo + " is not a regular file"},
      {"/dev/null", "unwilling to perform (53): /dev/null is not a regular file"},
  };
  const std::vector<Arguments> commands = {
      {"list"}, {"add", "vraslapd", "3700"}, {"delete", "ssh"}, {"port", "ssh"}, {"free-port"}};
  for (const Case& each : cases) {
    for (Arguments command : commands) {
      SCOPED_TRACE(each.path + " " + command[0]);
      const std::string line = "osutils: services " + command[0] + ": " + each.result + "\n";
      command.insert(command.begin(), "services");
      command.insert(command.begin() + 2, {"--file", each.path});
      expectFailure(osutils(command), line);
      command.insert(command.begin(), "--json");
      expectFailure(osutils(command), line);
    }
  }
  EXPECT_FALSE(pathExists(temp.path("missing")));
}

TEST_F(Tool, ReportsWhatTheEditorRefuses) {
  const std::string add = "osutils: services add: ";
  expectFailure(services({"add", "ssh", "3700"}),
                add + "already exists (68): " + file + " has a service \"ssh\"\n");
  for (const std::string port : {"53", "0", "-1", "400001"}) {
    SCOPED_TRACE(port);
    expectFailure(services({"add", "vraslapd", port}), add + "unavailable (52): port " + port +
                                                           " is taken in " + file +
                                                           " or not in 1 to 400000\n");
  }
  expectFailure(services({"delete", "SSH"}), "osutils: services delete: no such object (32): " +
                                                 file + " has no service \"SSH\"\n");
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, AFailedQuestionNamesWhatFailed) {
  expectFailure(services({"port", "directory"}), "osutils: services port: no such object (32): " +
                                                     file + " has no service \"directory\"\n");
  expectFailure(
      services({"free-port", "--json", "65536"}),
      "osutils: services free-port: unavailable (52): no free port from 65536 to 65535 in " + file +
          "\n");
}

TEST_F(Tool, AddRefusesANameThatCouldNotBeReadBack) {
  const std::vector<std::string> names = {
      "",       "1ldap",      "#ldap",   "_ldap",   "\303\244ldap",      " ldap", "ld ap", "ld\tap",
      "ldap\n", "l\nd 1/tcp", "ld\033p", "ld\177p", std::string(91, 'n')};
  for (const std::string& name : names) {
    SCOPED_TRACE(name);
    std::string shown = name;
    std::replace_if(
        shown.begin(), shown.end(), [](char c) { return (c >= 0 && c < ' ') || c == 127; }, '?');
    expectFailure(services({"add", name, "3700"}),
                  "osutils: services add: parameter error (89): NAME must begin with a letter and "
                  "have at most 90 characters, without white space: \"" +
                      shown + "\"\n");
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, RefusesWhatIsNoNumber) {
  for (const std::string port : {"", "x", "22x", "2 2", "0x16", "+22", "22.0", "99999999999"}) {
    SCOPED_TRACE(port);
    expectFailure(services({"add", "vraslapd", port}),
                  "osutils: services add: parameter error (89): PORT is not a whole number: \"" +
                      port + "\"\n");
    expectFailure(services({"free-port", port}),
                  "osutils: services free-port: parameter error (89): START is not a whole number: "
                  "\"" +
                      port + "\"\n");
  }
}

TEST_F(Tool, ReportsBadUsageInOneLine) {
  struct Case {
    Arguments arguments;
    std::string beginning;
  };
  const Case cases[] = {
      {{}, "osutils: "},
      {{"unknown"}, "osutils: "},
      {{"--unknown"}, "osutils: "},
      {{"services"}, "osutils: services: "},
      {{"services", "unknown"}, "osutils: services: "},
      {{"services", "list", "extra"}, "osutils: services list: "},
      {{"services", "list", "ex\ntra"}, "osutils: services list: "},
      {{"services", "list", "--unknown"}, "osutils: services list: "},
      {{"services", "list", "--file"}, "osutils: services list: "},
      {{"services", "list", "--json=maybe"}, "osutils: services list: "},
      {{"services", "list", "add"}, "osutils: services list: "},
      {{"services", "add"}, "osutils: services add: "},
      {{"services", "add", "vraslapd"}, "osutils: services add: "},
      {{"services", "add", "vraslapd", "3700", "extra"}, "osutils: services add: "},
      {{"services", "delete"}, "osutils: services delete: "},
      {{"services", "port"}, "osutils: services port: "},
      {{"services", "free-port", "1", "2"}, "osutils: services free-port: "},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.beginning + ::testing::PrintToString(each.arguments));
    expectFailure(osutils(each.arguments), StartsWith(each.beginning + "parameter error (89): "));
  }
}

TEST_F(Tool, AddRefusesAFileWhoseLastLineIsIncomplete) {
  writeFile(file, "ssh 22/tcp");
  expectFailure(services({"add", "vraslapd", "3700"}),
                "osutils: services add: unwilling to perform (53): the last line of " + file +
                    " has no newline, the new one would join it\n");
  EXPECT_EQ(contentsOf(file), "ssh 22/tcp");
}

TEST_F(Tool, DeleteRefusesTheFileAsItsOwnBackup) {
  expectFailure(services({"delete", "--backup", file, "ssh"}),
                "osutils: services delete: unwilling to perform (53): the backup path " + file +
                    " leads to the file itself\n");
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, ReportsADeletionThatRemovedNoLine) {
  const std::string contents = std::string(95, 'a') + " 7/tcp\n";
  writeFile(file, contents);
  const std::string listed(90, 'a');
  expectFailure(services({"delete", listed}),
                "osutils: services delete: unwilling to perform (53): no line of " + file +
                    " has the whole name \"" + listed + "\"\n");
  EXPECT_EQ(contentsOf(file), contents);
}

TEST_F(Tool, ReportsRefusedPermissions) {
  REQUIRE_OTHER_USERS();
  const std::string closed = temp.dir("closed");
  writeFile(closed + "/services", kServices);
  ASSERT_EQ(chmod(closed.c_str(), 0700), 0);
  const std::string hidden = temp.file("hidden", kServices);
  ASSERT_EQ(chmod(hidden.c_str(), 0600), 0);

  struct Case {
    Arguments arguments;
    std::string line;
  };
  const Case cases[] = {
      {{"list", "--file", closed + "/services"},
       "list: insufficient access (50): cannot read " + closed + "/services\n"},
      {{"list", "--file", hidden}, "list: unwilling to perform (53): cannot read " + hidden + "\n"},
      {{"add", "--file", file, "vraslapd", "3700"},
       "add: insufficient access (50): cannot write " + file + ": Permission denied\n"},
      {{"delete", "--file", file, "ssh"},
       "delete: insufficient access (50): cannot write " + file + ": Permission denied\n"},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.line);
    EXPECT_EQ(asUser(kNobody,
                     [&] {
                       Arguments arguments = each.arguments;
                       arguments.insert(arguments.begin(), "services");
                       expectFailure(osutils(arguments, dropCoverageCounters),
                                     "osutils: services " + each.line);
                       return ::testing::Test::HasFailure() ? 1 : 0;
                     }),
              0);
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

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
      "osutils: services add: " + output + "Bad file descriptor; what was asked for is done\n");
  EXPECT_THAT(contentsOf(file), AllOf(StartsWith(kServices), EndsWith("#\nvraslapd\t3700/tcp\n")));
}

TEST_F(Tool, ReportsATraceThatCannotBeStarted) {
  for (const std::string& directory :
       {temp.path("services/below"), std::string("/dev/null"), std::string()}) {
    SCOPED_TRACE(directory);
    expectFailure(
        services({"add", "--trace", directory, "vraslapd", "3700"}),
        "osutils: services add: operations error (1): cannot start tracing in " + directory + "\n");
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

// ---- Traces ----

// The records of a trace in order: "> function" for an entry, "< function" for an exit.
std::vector<std::string> callsIn(const std::string& directory) {
  const Result result = runProgram({"/usr/bin/env", "babeltrace2", directory});
  EXPECT_EQ(result.status, 0) << result.err;
  const std::regex call(R"re(type = \( "(entry|exit|exit_error)" .*function = \( "([^"]+)" )re");
  std::vector<std::string> calls;
  std::istringstream lines(result.out);
  for (std::string line; std::getline(lines, line);) {
    std::smatch match;
    if (std::regex_search(line, match, call)) {
      calls.push_back((match[1] == "entry" ? "> " : "< ") + match[2].str());
    }
  }
  return calls;
}

// Those that are calls of the tool itself, without the calls that they make in turn.
std::vector<std::string> outerCalls(const std::vector<std::string>& calls) {
  std::vector<std::string> outer;
  int depth = 0;
  for (const std::string& call : calls) {
    if (call[0] == '<') {
      --depth;
    } else if (depth++ == 0) {
      outer.push_back(call.substr(2));
    }
  }
  EXPECT_EQ(depth, 0);
  return outer;
}

class Trace : public Tool {
 protected:
  void SetUp() override {
    if (runProgram({"/usr/bin/env", "babeltrace2", "--version"}).status != 0) {
      GTEST_SKIP() << "babeltrace2 is not installed";
    }
  }

  const std::string trace = temp.path("trace");
};

TEST_F(Trace, HoldsTheCallsOfACommandInOrder) {
  expectAnswer(services({"free-port", "--trace", trace, "53"}), "PORT\n54\n");
  EXPECT_THAT(callsIn(trace),
              ElementsAre("> EtcServices::EtcServices", "< EtcServices::EtcServices",  //
                          "> checkFilePerms", "> doesFileExist", "< doesFileExist", "> isDirectory",
                          "< isDirectory", "< checkFilePerms",  //
                          "> isFile", "< isFile",               //
                          "> EtcServices::readEtcServices",     //
                          "> EtcServices::freeServicesEntries",
                          "< EtcServices::freeServicesEntries",  //
                          "> checkFilePerms", "> doesFileExist", "< doesFileExist", "> isDirectory",
                          "< isDirectory", "< checkFilePerms",
                          "< EtcServices::readEtcServices",  //
                          "> EtcServices::findAvaliablePort", "> EtcServices::isPortAvaliable",
                          "< EtcServices::isPortAvaliable", "> EtcServices::isPortAvaliable",
                          "< EtcServices::isPortAvaliable",
                          "< EtcServices::findAvaliablePort",  //
                          "> EtcServices::~EtcServices", "> EtcServices::freeServicesEntries",
                          "< EtcServices::freeServicesEntries", "< EtcServices::~EtcServices"));
}

TEST_F(Trace, HoldsTheEditAndTheSecondReading) {
  const std::string deletion = temp.path("deletion");
  expectAnswer(services({"add", "--trace", trace, "vraslapd", "3700"}),
               "NAME      PORT\nvraslapd  3700\n");
  expectAnswer(services({"delete", "--trace", deletion, "--json", "vraslapd"}),
               "{\"deleted\":\"vraslapd\"}\n");

  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("checkFilePerms", "checkFilePerms", "isFile", "EtcServices::EtcServices",
                          "checkFilePerms", "isFile", "EtcServices::readEtcServices",
                          "EtcServices::doesServiceExist", "EtcServices::isPortAvaliable",
                          "EtcServices::addService", "EtcServices::EtcServices", "checkFilePerms",
                          "isFile", "EtcServices::readEtcServices", "EtcServices::getServicePort",
                          "EtcServices::~EtcServices", "EtcServices::~EtcServices"));
  EXPECT_THAT(outerCalls(callsIn(deletion)),
              ElementsAre("checkFilePerms", "checkFilePerms", "isFile", "EtcServices::EtcServices",
                          "checkFilePerms", "isFile", "EtcServices::readEtcServices",
                          "EtcServices::doesServiceExist", "EtcServices::deleteService",
                          "EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::~EtcServices", "EtcServices::~EtcServices"));
}

TEST_F(Trace, IsKeptWhenTheCommandFails) {
  expectFailure(services({"port", "--trace", trace, "vraslapd"}),
                StartsWith("osutils: services port: no such object (32): " + file));
  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::~EtcServices"));
}

TEST_F(Trace, RecordsOnlyTheEventsThatTheEnvironmentAsksFor) {
  const Result result =
      services({"free-port", "--trace", trace}, [] { setenv("TRC_EVENTS", "entry43", 1); });
  expectAnswer(result, "PORT\n3700\n");
  EXPECT_THAT(
      callsIn(trace),
      ElementsAre("> EtcServices::freeServicesEntries", "< EtcServices::freeServicesEntries",
                  "> EtcServices::freeServicesEntries", "< EtcServices::freeServicesEntries"));
}

TEST_F(Trace, HoldsTheCallsOfEveryFamily) {
  struct Case {
    Arguments arguments;
    std::vector<std::string> calls;
  };
  const std::string kept = temp.file("kept", "kept");
  const std::string copy = temp.path("copy");
  const std::string made = temp.path("made");
  const std::string inittab = temp.file("inittab", "id:2:initdefault:x\n");
  // The calls of a command on the inittab file; "" stands for those that look at the file first.
  const auto inittabCalls = [](std::vector<std::string> methods) {
    methods.insert(methods.begin(), {"EtcInittab", "", "readInittab"});
    methods.push_back("~EtcInittab");
    std::vector<std::string> calls;
    for (const std::string& method : methods) {
      if (method.empty()) {
        calls.insert(calls.end(), {"checkFilePerms", "isFile"});
      } else {
        calls.push_back("EtcInittab::" + method);
      }
    }
    return calls;
  };
  const auto inittabEdit = [&](std::vector<std::string> methods) {
    std::vector<std::string> calls = inittabCalls(std::move(methods));
    calls.insert(calls.begin(), {"checkFilePerms", "checkFilePerms", "isFile"});
    return calls;
  };
  const Case cases[] = {
      {{"db"}, {"getXQ4PathAndVersion", "getVRAInstallPath", "checkFilePerms", "checkFilePerms"}},
      {{"file", "stat", kept},
       {"getFileNameFromPath", "doesFileExist", "canAccessFile", "isDirectory", "isFile"}},
      {{"file", "check", kept}, {"checkFilePerms"}},
      {{"file", "copy", kept, copy},
       {"checkFilePerms", "isFile", "checkFilePerms", "doesFileExist", "copyFile",
        "getFileOwnersAndPermissions"}},
      {{"file", "create", "--force", copy},
       {"checkFilePerms", "isFile", "createFile", "getFileOwnersAndPermissions"}},
      {{"file", "owner", kept}, {"getFileOwnersAndPermissions"}},
      {{"file", "owner", "--mode", "600", kept},
       {"getFileOwnersAndPermissions", "setFileOwnersAndPermissions",
        "getFileOwnersAndPermissions"}},
      {{"file", "clear", kept}, {"checkFilePerms", "isFile", "clearFile"}},
      {{"file", "delete", kept}, {"deleteFile"}},
      {{"dir", "create", made}, {"createDirectory", "getFileOwnersAndPermissions"}},
      {{"dir", "delete", made}, {"deleteDirectory"}},
      {{"dir", "delete", "--force", temp.dir("tree")}, {"deleteDirForcefully"}},
      {{"dir", "delete", "--force", temp.path() + "/#"}, {}},
      {{"dir", "trim", made}, {"trimLastDirectory"}},
      {{"space", "0", temp.path()}, {"doesFileExist", "isEnoughDriveSpace"}},
      {{"user", "exists", "root"}, {"doesUserExist"}},
      {{"user", "valid", "a;b"}, {"isValidUser"}},
      {{"user", "valid", "a b"}, {}},
      {{"user", "home", "root"}, {"doesUserExist", "getUserHomeDir"}},
      {{"user", "group", "root"}, {"getUsersPrimaryGroup"}},
      {{"group", "exists", "root"}, {"doesGroupExist"}},
      {{"group", "members", "root"}, {"doesGroupExist"}},
      {{"group", "has", "root", "root"}, {"doesGroupExist", "isMemberOfGroup"}},
      {{"name", "check", "inst1"}, {"isValidName"}},
      {{"screen", "a", "b"}, {}},
      {{"time"}, {"getCurrentTimeStamp"}},
      {{"inittab", "list", "--file", inittab}, inittabCalls({"getInittabEntryWithCommand"})},
      {{"inittab", "find", "--file", inittab, "x"}, inittabCalls({"getInittabEntryWithCommand"})},
      {{"inittab", "free-id", "--file", inittab}, inittabCalls({"findAvaliableID"})},
      {{"inittab", "add", "--file", inittab, "new", "2", "wait", "x"},
       inittabEdit({"doesInittabEntryExist", "addInittabEntry", "EtcInittab", "", "readInittab",
                    "getInittabEntry", "~EtcInittab"})},
      {{"inittab", "delete", "--file", inittab, "new"},
       inittabEdit({"doesInittabEntryExist", "deleteInittabEntry", "EtcInittab", "", "readInittab",
                    "doesInittabEntryExist", "~EtcInittab"})},
      {{"process", "start", "--launcher-dir", temp.path(), "a"}, {"startProcess"}},
      {{"process", "start", "--launcher-dir", temp.path(), "a b"}, {}},
      {{"process", "stop", std::to_string(kNoProcess)}, {"stopProcess"}},
      {{"process", "status", "1", "no-such-one"}, {"isProcessStarted"}},
      {{"platform"}, {}},
      {{"module", "check", "libc.so.6"}, {"loadSharedLib", "unloadSharedLib"}},
      {{"module", "check", "libc.so.6", "malloc"},
       {"loadSharedLib", "getSymAddress", "unloadSharedLib"}},
      {{"module", "check", temp.path("missing")}, {"loadSharedLib"}},
      {{"net", "addresses", "--localhost"}, {"getLocalHostIPAddress"}},
      {{"dn", "format", "a=b"}, {"formatDn"}},
      {{"dn", "compare", "a=b", "a=c"}, {"formatDn", "formatDn"}},
  };
  int number = 0;
  for (const Case& each : cases) {
    SCOPED_TRACE(::testing::PrintToString(each.arguments));
    const std::string directory = trace + std::to_string(++number);
    Arguments arguments = {"--trace", directory};
    arguments.insert(arguments.end(), each.arguments.begin(), each.arguments.end());
    (void)osutils(arguments);
    if (each.calls.empty()) {
      EXPECT_THAT(runProgram({"/usr/bin/env", "babeltrace2", directory}).out,
                  ::testing::Not(HasSubstr("\"entry\"")));
    } else {
      EXPECT_EQ(outerCalls(callsIn(directory)), each.calls);
    }
  }
}

TEST_F(Trace, HoldsNoCallOfARefusedStop) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([this] {
    expectFailure(osutils({"process", "stop", "--trace", trace, "0"}),
                  StartsWith("osutils: process stop: parameter error (89): "));
  });
  EXPECT_TRUE(pathExists(trace));
  EXPECT_THAT(runProgram({"/usr/bin/env", "babeltrace2", trace}).out,
              ::testing::Not(HasSubstr("\"entry\"")));
}

// ---- Installation and database ----

TEST_F(Layout, ShowsAllPathsAndWhatOfThemExists) {
  temp.dir("root/lib64");
  temp.file("root/lib64/libvradbutils.so", "");
  const auto line = [](const std::string& name, const std::string& path, bool exists) {
    return R"({"name":")" + name + R"(","path":")" + path + R"(","exists":)" +
           (exists ? "true" : "false") + "}";
  };
  const Result result = atRoot({"paths", "--json"});
  expectAnswer(
      result, "[" + line("install", root, true) + "," + line("lib", root + "/lib64", true) + "," +
                  line("sbin", root + "/sbin", false) + "," +
                  line("launcher", root + "/sbin/64/vrarun", false) + "," +
                  line("schema", root + "/etc/SchemaV6.1", false) + "," +
                  line("var", "/var/vraldap/V6.1", pathExists("/var/vraldap/V6.1")) + "," +
                  line("admin log", "/var/vraldap/V6.1/vraadm.log",
                       pathExists("/var/vraldap/V6.1/vraadm.log")) +
                  "," +
                  line("database log", "/var/vraldap/V6.1/vraadmxq4.log",
                       pathExists("/var/vraldap/V6.1/vraadmxq4.log")) +
                  "," +
                  line("database commands log", "/var/vraldap/V6.1/vraadmxq4cmds.log",
                       pathExists("/var/vraldap/V6.1/vraadmxq4cmds.log")) +
                  "," + line("database component", root + "/lib64/libvradbutils.so", true) + "]\n");
}

TEST_F(Layout, ShowsTheDefaultRootAndAnotherSchema) {
  const Result result = osutils({"paths", "--schema", "7"});
  EXPECT_EQ(result.status, 0);
  EXPECT_THAT(
      result.out,
      AllOf(StartsWith("NAME                   PATH"),
            HasSubstr("\nschema                 /opt/orx/ldap/V6.1/etc/SchemaV7 "),
            HasSubstr("\ndatabase component     /opt/orx/ldap/V6.1/lib64/libvradbutils.so")));
  EXPECT_EQ(result.err, "");
}

TEST_F(Layout, FindsTheDatabaseOfTheProductTheInstanceAndTheMigration) {
  const auto properties = [](const std::string& number) {
    return "currentXQ4Version=9." + number + "\ncurrentXQ4InstallPath=/opt/db" + number + "/\n";
  };
  writeFile(etc + "/ldapdb.properties", properties("1"));
  temp.dir("home");
  temp.dir("home/vraslapd-inst1");
  temp.dir("home/vraslapd-inst1/etc");
  temp.file("home/vraslapd-inst1/etc/ldapdb.properties", properties("2"));
  temp.dir("backup");
  temp.dir("backup/etc");
  temp.file("backup/etc/xq4info", properties("3"));

  expectAnswer(atRoot({"db"}), "PATH      VERSION\n/opt/db1  9.1\n");
  expectAnswer(atRoot({"db", "--instance", "inst1", "--location", temp.path("home")}),
               "PATH      VERSION\n/opt/db2  9.2\n");
  expectAnswer(atRoot({"db", "--migration", temp.path("backup"), "--json"}),
               R"({"path":"/opt/db3","version":"9.3"})"
               "\n");
}

TEST_F(Layout, NamesTheFileInWhichNoDatabaseWasFound) {
  const auto line = [](const std::string& path, const std::string& result) {
    return "osutils: db: no database path and version found in " + path +
           "; checkFilePerms answers " + result + " for " + path + "\n";
  };
  const std::string product = etc + "/ldapdb.properties";
  expectFailure(atRoot({"db"}), line(product, "no such object (32)"));
  for (const char* contents : {"", "currentXQ4InstallPath=/opt/db\n", "currentXQ4Version=9.1\n"}) {
    SCOPED_TRACE(contents);
    writeFile(product, contents);
    expectFailure(atRoot({"db"}),
                  "osutils: db: no such object (32): no database path and version found in " +
                      product + "\n");
  }
  expectFailure(atRoot({"db", "--instance", "a", "--location", temp.path()}),
                line(temp.path("vraslapd-a/etc/ldapdb.properties"), "no such object (32)"));
  temp.dir("xq4info");
  expectFailure(atRoot({"db", "--migration", temp.path(), "--json"}),
                line(temp.path("etc/xq4info"), "no such object (32)"));
}

TEST_F(Layout, AnInvalidVersionLeavesTheLibrarysMessageBeforeTheFailure) {
  const std::string product = etc + "/ldapdb.properties";
  writeFile(product, "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=nine\n");
  const Result result = atRoot({"db"});
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err, "The file " + product +
                            " holds an invalid database version.\n"
                            "osutils: db: no such object (32): no database path and version "
                            "found in " +
                            product + "\n");
}

// ---- Files ----

class Files : public Tool {
 protected:
  // The answer of `file owner` and of what makes files.
  std::string owned(const std::string& path, const std::string& mode,
                    const std::string& owner = user, const std::string& group = own_group) const {
    return R"({"path":")" + path + R"(","owner":")" + owner + R"(","group":")" + group +
           R"(","mode":")" + mode + "\"}\n";
  }
  // What a failed call that has no result code leaves.
  // `result` is what checkFilePerms says of the path, empty when that finds nothing wrong.
  static std::string failed(const std::string& command, const std::string& what,
                            const std::string& result, const std::string& path) {
    if (result.empty()) return "osutils: " + command + ": operations error (1): " + what + "\n";
    return "osutils: " + command + ": " + what + "; checkFilePerms answers " + result + " for " +
           path + "\n";
  }

  static std::string nameFrom(const char* option) {
    std::string text = runProgram({"/usr/bin/env", "id", option}).out;
    if (!text.empty()) text.pop_back();
    return text;
  }
  static inline const std::string user = nameFrom("-un");
  static inline const std::string own_group = nameFrom("-gn");
};

TEST_F(Files, StatShowsWhatIsKnownAboutAPath) {
  const auto line = [](const std::string& path, const std::string& name, const std::string& rest) {
    return R"({"path":")" + path + R"(","name":")" + name + R"(",)" + rest + "}\n";
  };
  expectAnswer(
      osutils({"file", "stat", "--json", file}),
      line(file, "services", R"("exists":true,"accessible":true,"directory":false,"file":true)"));
  expectAnswer(osutils({"file", "stat", "--json", temp.dir("d")}),
               line(temp.path("d"), "d",
                    R"("exists":true,"accessible":true,"directory":true,"file":false)"));
  expectAnswer(osutils({"file", "stat", "--json", temp.path("missing")}),
               line(temp.path("missing"), "missing",
                    R"("exists":false,"accessible":true,"directory":false,"file":false)"));
  EXPECT_FALSE(pathExists(temp.path("missing")));
  expectAnswer(osutils({"file", "stat", "/dev/null"}),
               "PATH       NAME  EXISTS  ACCESSIBLE  DIRECTORY  FILE\n"
               "/dev/null  null  true    true        false      false\n");
}

TEST_F(Files, CheckAnswersTheResultCode) {
  expectAnswer(osutils({"file", "check", "--json", file}),
               R"({"path":")" + file + R"(","code":0})" + "\n");
  const std::string failure = "osutils: file check: ";
  expectFailure(osutils({"file", "check", temp.path()}),
                failure + "constraint violation (19): " + temp.path() + "\n");
  expectFailure(osutils({"file", "check", "--json", temp.path("missing")}),
                failure + "no such object (32): " + temp.path("missing") + "\n");
}

TEST_F(Files, CopyMakesANewFileWithTheModeAskedFor) {
  const std::string copy = temp.path("copy");
  expectAnswer(
      osutils({"file", "copy", "--mode", "604", "--json", file, copy}),
      R"({"source":")" + file + R"(","destination":")" + copy + R"(","created":true})" + "\n");
  EXPECT_EQ(contentsOf(copy), kServices);
  EXPECT_EQ(modeOf(copy), 0604U);

  const std::string plain = temp.path("plain");
  EXPECT_EQ(osutils({"file", "copy", file, plain}).status, 0);
  EXPECT_EQ(modeOf(plain), 0640U);
}

TEST_F(Files, CopyOverwritesAnExistingFileAndLeavesItsMode) {
  const std::string copy = temp.file("copy", std::string(100'000, 'x'));
  expectAnswer(
      osutils({"file", "copy", "--mode", "600", "--json", file, copy}),
      R"({"source":")" + file + R"(","destination":")" + copy + R"(","created":false})" + "\n");
  EXPECT_EQ(contentsOf(copy), kServices);
  EXPECT_EQ(modeOf(copy), 0644U);
}

TEST_F(Files, CopyRefusesTheFileItselfUnderEachOfItsNames) {
  const std::string link = temp.path("link");
  const std::string hard = temp.path("hard");
  ASSERT_EQ(symlink(file.c_str(), link.c_str()), 0);
  ASSERT_EQ(::link(file.c_str(), hard.c_str()), 0);
  for (const std::string& name : {file, link, hard}) {
    expectFailure(osutils({"file", "copy", file, name}),
                  "osutils: file copy: unwilling to perform (53): " + file + " and " + name +
                      " are the same file\n");
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Files, CopyRefusesWhatCannotBeCheckedAfterwards) {
  const std::string fifo = temp.path("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  for (const Arguments& paths : {Arguments{fifo, temp.path("copy")}, Arguments{file, fifo}}) {
    expectFailure(
        osutils({"file", "copy", paths[0], paths[1]}),
        "osutils: file copy: unwilling to perform (53): " + fifo + " is not a regular file\n");
  }
  EXPECT_FALSE(pathExists(temp.path("copy")));
}

TEST_F(Files, CopyNamesThePathThatFails) {
  const std::string copy = temp.path("copy");
  const std::string missing = temp.path("missing");
  const std::string below = missing + "/copy";
  const std::string directory = temp.dir("directory");
  const auto line = [](const std::string& source, const std::string& destination,
                       const std::string& result, const std::string& path) {
    return failed("file copy", "cannot copy " + source + " to " + destination, result, path);
  };
  expectFailure(osutils({"file", "copy", missing, copy}),
                line(missing, copy, "no such object (32)", missing));
  expectFailure(osutils({"file", "copy", directory, copy}),
                line(directory, copy, "constraint violation (19)", directory));
  expectFailure(osutils({"file", "copy", file, directory}),
                line(file, directory, "constraint violation (19)", directory));
  EXPECT_FALSE(pathExists(copy));
}

TEST_F(Files, CopyReportsAFullDisk) {
  const std::string copy = temp.path("copy");
  expectFailure(osutils({"file", "copy", file, copy}, [] { limitFileSize(10); }),
                "osutils: file copy: operations error (1): the copy of " + file +
                    " is not complete in " + copy + "\n");
}

TEST_F(Files, CreateMakesAnEmptyFileAndShowsItsOwnership) {
  const std::string path = temp.path("new");
  expectAnswer(osutils({"file", "create", "--json", path}), owned(path, "0640"));
  EXPECT_EQ(modeOf(path), 0640U);
  writeFile(path, "old");
  expectFailure(osutils({"file", "create", path}),
                "osutils: file create: already exists (68): " + path +
                    " exists; with --force it is made anew, without its contents\n");
  EXPECT_EQ(contentsOf(path), "old");
  expectAnswer(osutils({"file", "create", "--force", "--owner", user, "--group", own_group,
                        "--mode", "0700", "--json", path}),
               owned(path, "0700"));
  EXPECT_EQ(contentsOf(path), "");
  EXPECT_EQ(modeOf(path), 0700U);
}

TEST_F(Files, GivesAwayWhatItMakes) {
  REQUIRE_ROOT("to give files away");
  const std::string directory = temp.path("made");
  const std::string path = temp.path("new");
  expectAnswer(osutils({"file", "create", "--owner", "daemon", "--json", path}),
               owned(path, "0640", "daemon", "daemon"));
  expectAnswer(osutils({"dir", "create", "--owner", "daemon", "--group", "sys", "--mode", "2770",
                        "--json", directory}),
               owned(directory, "2770", "daemon", "sys"));
  EXPECT_EQ(modeOf(directory), 02770U);
  const std::string copy = temp.path("copy");
  EXPECT_EQ(osutils({"file", "copy", "--owner", "daemon", "--group", "sys", file, copy}).status, 0);
  expectAnswer(osutils({"file", "owner", "--json", copy}), owned(copy, "0640", "daemon", "sys"));
}

TEST_F(Files, CreateReportsWhyItFails) {
  const std::string below = temp.path("missing/new");
  expectFailure(osutils({"file", "create", below}),
                failed("file create", "cannot create " + below, "no such object (32)", below));
  expectFailure(osutils({"file", "create", temp.path()}),
                failed("file create", "cannot create " + temp.path(), "constraint violation (19)",
                       temp.path()));
}

TEST_F(Files, AnUnknownAccountIsReportedBeforeAnythingIsDone) {
  const std::string path = temp.file("path", "kept");
  const std::string made = temp.path("made");
  const std::vector<Arguments> commands = {{"file", "create", path},
                                           {"file", "copy", file, made},
                                           {"file", "owner", path},
                                           {"dir", "create", made}};
  for (const Arguments& command : commands) {
    for (const std::string kind : {"owner", "group"}) {
      SCOPED_TRACE(command[1] + kind);
      for (const std::string name : {"", "no-such-one"}) {
        Arguments arguments = command;
        arguments.insert(arguments.begin() + 2, {"--" + kind, name});
        expectFailure(osutils(arguments), "osutils: " + command[0] + " " + command[1] +
                                              ": no such object (32): there is no " +
                                              (kind == "owner" ? "user" : "group") + " \"" + name +
                                              "\"\n");
      }
    }
  }
  EXPECT_EQ(contentsOf(path), "kept");
  EXPECT_FALSE(pathExists(made));
}

TEST_F(Files, RefusesAModeThatIsNotOctal) {
  const std::string path = temp.file("path", "kept");
  const std::string made = temp.path("made");
  const std::vector<Arguments> commands = {{"file", "create", path},
                                           {"file", "copy", file, made},
                                           {"file", "owner", path},
                                           {"dir", "create", made}};
  for (const Arguments& command : commands) {
    for (const std::string mode :
         {"", "8", "u+x", "-1", "0x1ff", "+644", "644 ", "10000", "99999999999", "0o644"}) {
      SCOPED_TRACE(command[1] + mode);
      Arguments arguments = command;
      arguments.insert(arguments.begin() + 2, "--mode=" + mode);
      expectFailure(osutils(arguments),
                    "osutils: " + command[0] + " " + command[1] +
                        ": parameter error (89): --mode is not an octal mode from 0 to 7777: \"" +
                        mode + "\"\n");
    }
  }
  EXPECT_EQ(contentsOf(path), "kept");
  EXPECT_EQ(modeOf(path), 0644U);
  EXPECT_FALSE(pathExists(made));
}

TEST_F(Files, DeleteRemovesFilesAndLinksOnly) {
  const std::string path = temp.file("path", "");
  const std::string link = temp.path("link");
  ASSERT_EQ(symlink("nowhere", link.c_str()), 0);
  expectAnswer(osutils({"file", "delete", path}), "DELETED\n" + path + "\n");
  expectAnswer(osutils({"file", "delete", "--json", link}), R"({"deleted":")" + link + "\"}\n");
  EXPECT_FALSE(pathExists(path));
  EXPECT_FALSE(pathExists(link));

  expectFailure(osutils({"file", "delete", path}),
                failed("file delete", "cannot delete " + path, "no such object (32)", path));
  const std::string directory = temp.dir("directory");
  expectFailure(
      osutils({"file", "delete", directory}),
      failed("file delete", "cannot delete " + directory, "constraint violation (19)", directory));
  EXPECT_TRUE(pathExists(directory));
}

TEST_F(Files, ClearEmptiesAFileOrMakesIt) {
  const std::string missing = temp.path("missing");
  expectAnswer(osutils({"file", "clear", file}), "CLEARED\n" + file + "\n");
  EXPECT_EQ(contentsOf(file), "");
  EXPECT_EQ(modeOf(file), 0644U);
  expectAnswer(osutils({"file", "clear", "--json", missing}),
               R"({"cleared":")" + missing + "\"}\n");
  EXPECT_EQ(modeOf(missing), 0600U);
}

TEST_F(Files, ClearReportsWhyItFails) {
  const std::string fifo = temp.path("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  for (const std::string& path : {fifo, std::string("/dev/null")}) {
    expectFailure(
        osutils({"file", "clear", path}),
        "osutils: file clear: unwilling to perform (53): " + path + " is not a regular file\n");
  }
  expectFailure(osutils({"file", "clear", temp.path()}),
                failed("file clear", "cannot clear " + temp.path(), "constraint violation (19)",
                       temp.path()));
  const std::string below = temp.path("missing/below");
  expectFailure(osutils({"file", "clear", below}),
                failed("file clear", "cannot clear " + below, "no such object (32)", below));
}

TEST_F(Files, OwnerShowsAndSetsOnlyWhatIsAskedFor) {
  expectAnswer(osutils({"file", "owner", "--json", file}), owned(file, "0644"));
  expectAnswer(osutils({"file", "owner", "--mode", "1600", "--json", file}), owned(file, "1600"));
  expectAnswer(osutils({"file", "owner", "--owner", user, "--json", file}), owned(file, "1600"));
  expectAnswer(osutils({"file", "owner", "--group", own_group, "--json", file}),
               owned(file, "1600"));
  EXPECT_EQ(modeOf(file), 01600U);
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Files, OwnerGivesAFileAwayAndKeepsWhatIsNotNamed) {
  REQUIRE_ROOT("to give files away");
  expectAnswer(osutils({"file", "owner", "--owner", "daemon", "--json", file}),
               owned(file, "0644", "daemon", "root"));
  expectAnswer(osutils({"file", "owner", "--group", "sys", "--mode", "4755", "--json", file}),
               owned(file, "4755", "daemon", "sys"));
}

TEST_F(Files, OwnerNeedsAllThreeForAFileOfUnknownAccounts) {
  REQUIRE_ROOT("to give files away");
  ASSERT_EQ(chown(file.c_str(), 3'999'999, 3'999'999), 0);
  const std::string line =
      failed("file owner", "cannot tell the owner and group of " + file, "", file);
  expectFailure(osutils({"file", "owner", file}), line);
  expectFailure(osutils({"file", "owner", "--owner", "root", "--mode", "600", file}), line);
  expectAnswer(osutils({"file", "owner", "--owner", "root", "--group", "root", "--mode", "600",
                        "--json", file}),
               owned(file, "0600", "root", "root"));
}

TEST_F(Files, OwnerReportsAMissingFile) {
  const std::string missing = temp.path("missing");
  expectFailure(osutils({"file", "owner", missing}),
                failed("file owner", "cannot tell the owner and group of " + missing,
                       "no such object (32)", missing));
  expectFailure(
      osutils({"file", "owner", "--owner", user, "--group", own_group, "--mode", "600", missing}),
      failed("file owner", "cannot set the owner, group and mode of " + missing,
             "no such object (32)", missing));
}

TEST_F(Files, ReportsWhatAnotherUserMayNot) {
  REQUIRE_OTHER_USERS();
  const std::string closed = temp.dir("closed");
  const std::string hidden = closed + "/hidden";
  writeFile(hidden, "kept");
  ASSERT_EQ(chmod(closed.c_str(), 0700), 0);
  const std::string tree = temp.dir("tree");
  temp.file("tree/kept", "");
  const std::string beside = temp.path("new");
  struct Case {
    Arguments arguments;
    std::string line;
  };
  const std::string hidden_result = "insufficient access (50)";
  const Case cases[] = {
      {{"file", "check", hidden}, "osutils: file check: " + hidden_result + ": " + hidden + "\n"},
      {{"file", "copy", hidden, beside},
       failed("file copy", "cannot copy " + hidden + " to " + beside, hidden_result, hidden)},
      {{"file", "copy", file, hidden},
       failed("file copy", "cannot copy " + file + " to " + hidden, hidden_result, hidden)},
      {{"file", "create", hidden},
       failed("file create", "cannot create " + hidden, hidden_result, hidden)},
      {{"file", "create", beside},
       failed("file create", "cannot create " + beside, "no such object (32)", beside)},
      {{"file", "delete", file}, failed("file delete", "cannot delete " + file, "", file)},
      {{"file", "clear", file}, failed("file clear", "cannot clear " + file, "", file)},
      {{"file", "owner", hidden},
       failed("file owner", "cannot tell the owner and group of " + hidden, hidden_result, hidden)},
      {{"file", "owner", "--mode", "777", file},
       failed("file owner", "cannot set the owner, group and mode of " + file, "", file)},
      {{"dir", "create", beside},
       failed("dir create", "cannot create " + beside, "no such object (32)", beside)},
      {{"dir", "delete", "--force", tree},
       failed("dir delete", "cannot delete " + tree, "constraint violation (19)", tree)},
      {{"space", "1", hidden},
       failed("space", "cannot tell the free space at " + hidden, hidden_result, hidden)},
  };
  asNobody([&] {
    for (const Case& each : cases) {
      SCOPED_TRACE(each.line);
      expectFailure(osutils(each.arguments, dropCoverageCounters), each.line);
    }
    expectAnswer(osutils({"file", "stat", "--json", hidden}, dropCoverageCounters),
                 R"({"path":")" + hidden +
                     R"(","name":"hidden","exists":false,"accessible":false,"directory":false,)"
                     R"("file":false})" +
                     "\n");
  });
  EXPECT_EQ(contentsOf(hidden), "kept");
  EXPECT_EQ(contentsOf(file), kServices);
  EXPECT_EQ(modeOf(file), 0644U);
  EXPECT_TRUE(pathExists(tree + "/kept"));
}

TEST_F(Files, ReportsAnOwnershipThatTheSystemRefused) {
  REQUIRE_OTHER_USERS();
  const std::string open = temp.dir("open");
  ASSERT_EQ(chmod(open.c_str(), 0777), 0);
  const std::string own = temp.file("own", "");
  ASSERT_EQ(chown(own.c_str(), kNobody, kNobody), 0);
  const std::string made = open + "/made";
  asNobody([&] {
    const std::string refused =
        " has another owner, group or mode than asked for: nobody, nogroup, ";
    expectFailure(osutils({"dir", "create", "--owner", "root", made}, dropCoverageCounters),
                  "osutils: dir create: insufficient access (50): " + made + refused + "0750\n");
    expectFailure(
        osutils({"file", "owner", "--group", "root", "--mode", "600", own}, dropCoverageCounters),
        "osutils: file owner: insufficient access (50): " + own + refused + "0600\n");
    const std::string file_made = open + "/file";
    expectFailure(
        osutils({"file", "create", "--owner", "root", file_made}, dropCoverageCounters),
        failed("file create", "cannot create " + file_made, "no such object (32)", file_made));
  });
  EXPECT_EQ(modeOf(own), 0600U);
}

TEST_F(Files, CreateReportsAFileThatCouldNotBeRemoved) {
  REQUIRE_OTHER_USERS();
  const std::string own = temp.file("own", "kept");
  ASSERT_EQ(chown(own.c_str(), kNobody, kNobody), 0);
  asNobody([&] {
    expectFailure(osutils({"file", "create", "--force", own}, dropCoverageCounters),
                  "osutils: file create: operations error (1): " + own +
                      " could not be removed and keeps its contents\n");
  });
  EXPECT_EQ(contentsOf(own), "kept");
}

// ---- Directories and free space ----

TEST_F(Files, MakesAndRemovesADirectory) {
  const std::string path = temp.path("made");
  expectAnswer(osutils({"dir", "create", "--json", path}), owned(path, "0750"));
  EXPECT_EQ(modeOf(path), 0750U);
  expectFailure(osutils({"dir", "create", path}),
                failed("dir create", "cannot create " + path, "constraint violation (19)", path));
  expectAnswer(osutils({"dir", "delete", path}), "DELETED\n" + path + "\n");
  EXPECT_FALSE(pathExists(path));
  expectFailure(osutils({"dir", "delete", path}),
                failed("dir delete", "cannot delete " + path, "no such object (32)", path));
  expectFailure(osutils({"dir", "delete", file}),
                failed("dir delete", "cannot delete " + file, "", file));
  EXPECT_TRUE(pathExists(file));
}

TEST_F(Files, OnlyForceRemovesADirectoryThatIsNotEmpty) {
  const std::string tree = temp.dir("tree");
  temp.dir("tree/below");
  temp.file("tree/below/with blank", "");
  ASSERT_EQ(symlink(file.c_str(), (tree + "/link").c_str()), 0);
  expectFailure(osutils({"dir", "delete", tree}),
                failed("dir delete", "cannot delete " + tree, "constraint violation (19)", tree));
  EXPECT_TRUE(pathExists(tree + "/below/with blank"));
  expectAnswer(osutils({"dir", "delete", "--force", "--json", tree}),
               R"({"deleted":")" + tree + "\"}\n");
  EXPECT_FALSE(pathExists(tree));
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Files, ForceRefusesAPathThatAShellWouldNotTakeAsItStands) {
  temp.dir("a");
  temp.dir("b");
  for (const std::string name :
       {"a b", "a\tb", "#",   "a#b", "a;b", "a&b",  "a`b",  "a'b",  "a\"b",
        "a|b", "a*b",  "a?b", "a~b", "a<b", "a>b",  "a^b",  "a(b",  "a)b",
        "a[b", "a]b",  "a{b", "a}b", "a$b", "a\\b", "a\nb", "a\rb", "-r"}) {
    SCOPED_TRACE(name);
    temp.dir(name);
    // relative, so that the leading character is the path's own
    const Result result = osutils({"dir", "delete", "--force", "--", name},
                                  [this] { (void)!chdir(temp.path().c_str()); });
    expectFailure(result, StartsWith("osutils: dir delete: parameter error (89): a shell would not "
                                     "take the path as it stands: \""));
    for (const std::string& kept : {name, std::string("a"), std::string("b")}) {
      EXPECT_TRUE(pathExists(temp.path(kept)));
    }
    EXPECT_EQ(rmdir(temp.path(name).c_str()), 0);
  }
  // without --force no shell is asked
  temp.dir("a b");
  expectAnswer(osutils({"dir", "delete", "--json", temp.path("a b")}),
               R"({"deleted":")" + temp.path("a b") + "\"}\n");
}

TEST_F(Files, ForceRemovesALinkAndNotWhatItLeadsTo) {
  const std::string target = temp.dir("target");
  writeFile(target + "/kept", "");
  const std::string link = temp.path("link");
  ASSERT_EQ(symlink(target.c_str(), link.c_str()), 0);
  expectAnswer(osutils({"dir", "delete", "--force", link + "/"}), "DELETED\n" + link + "\n");
  EXPECT_FALSE(pathExists(link));
  EXPECT_TRUE(pathExists(target + "/kept"));
}

TEST_F(Files, CommandsLearnHowTheShellEndedAlsoWhenSigchldIsIgnored) {
  const std::string tree = temp.dir("tree");
  const Result result = runProgram({OSUTILS_TOOL, "dir", "delete", "--force", tree},
                                   [] { signal(SIGCHLD, SIG_IGN); });
  expectAnswer(result, "DELETED\n" + tree + "\n");
}

TEST_F(Files, NothingButAFileIsMadeAnewOrRemovedAsADirectory) {
  const std::string pipe = temp.path("pipe");
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  expectFailure(
      osutils({"file", "create", pipe}),
      "osutils: file create: unwilling to perform (53): " + pipe + " is not a regular file\n");
  EXPECT_TRUE(pathExists(pipe));
  // A socket's type has the bit by which the library knows a directory.
  const int socket = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  const std::string path = temp.path("socket");
  ASSERT_LT(path.size(), sizeof address.sun_path);
  memcpy(address.sun_path, path.c_str(), path.size() + 1);
  ASSERT_EQ(bind(socket, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  close(socket);
  EXPECT_EQ(osutils({"dir", "delete", "--force", path}).status, 3);
  EXPECT_TRUE(pathExists(path));
}

TEST_F(Files, ForceReportsWhatIsNoDirectory) {
  const std::string missing = temp.path("missing");
  expectFailure(osutils({"dir", "delete", "--force", missing}),
                failed("dir delete", "cannot delete " + missing, "no such object (32)", missing));
  expectFailure(osutils({"dir", "delete", "--force", ""}),
                "osutils: dir delete: parameter error (89): a shell would not take the path as it "
                "stands: \"\"\n");
  expectFailure(osutils({"dir", "delete", "--force", file}),
                failed("dir delete", "cannot delete " + file, "", file));
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Files, TrimCutsTheLastDirectory) {
  expectAnswer(osutils({"dir", "trim", "/usr/lib"}), "PATH      TRIMMED\n/usr/lib  /usr\n");
  for (const auto& [path, trimmed] : {std::pair("/usr/", "/usr"), std::pair("/usr", ""),
                                      std::pair("usr", ""), std::pair("", "")}) {
    expectAnswer(
        osutils({"dir", "trim", "--json", path}),
        R"({"path":")" + std::string(path) + R"(","trimmed":")" + std::string(trimmed) + "\"}\n");
  }
}

TEST_F(Files, SpaceAnswersYesAndNo) {
  expectAnswer(osutils({"space", "--json", "0", temp.path()}),
               R"({"path":")" + temp.path() + R"(","mib":0,"enough":true})" + "\n");
  expectNo(osutils({"space", "--json", "99999999999999", temp.path()}),
           R"({"path":")" + temp.path() + R"(","mib":99999999999999,"enough":false})" + "\n");
  const std::string missing = temp.path("missing");
  expectFailure(
      osutils({"space", "0", missing}),
      failed("space", "cannot tell the free space at " + missing, "no such object (32)", missing));
}

TEST_F(Files, SpaceRefusesWhatIsNoNumber) {
  for (const std::string mib : {"", "x", "1x", "1.5", "0x1", "+1", "99999999999999999999"}) {
    SCOPED_TRACE(mib);
    expectFailure(
        osutils({"space", mib, temp.path()}),
        "osutils: space: parameter error (89): MIB is not a whole number: \"" + mib + "\"\n");
  }
}

// ---- Users and groups ----

// Runs the body with accounts of its own.
void withAccounts(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\nshadow: files\n");
              writeFile("/etc/passwd",
                        "root:x:0:0::/root:/bin/sh\n"
                        "ann:x:5001:6001::/srv/ann:/bin/sh\n"
                        "bob:x:5002:6999::/HOME:/bin/sh\n"
                        "locked:x:5003:6001::/:/bin/false\n"
                        "nobody:x:65534:65534::/:/bin/false\n");
              writeFile("/etc/group",
                        "root:x:0:\nstaff:x:6001:bob,Zoe\nempty:x:6002:\nnogroup:x:65534:\n");
              writeFile("/etc/shadow",
                        "root:*:19000:0:99999:7:::\nann:*:19000:0:99999:7:::\n"
                        "locked:*:19000:0:99999:7:::\n");
              body();
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(Accounts, AnswersQuestionsAboutUsers) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    expectAnswer(osutils({"user", "exists", "ann"}), "USER  EXISTS\nann   true\n");
    expectNo(osutils({"user", "exists", "Ann"}), "USER  EXISTS\nAnn   false\n");
    expectNo(osutils({"user", "exists", "--json", ""}), "{\"user\":\"\",\"exists\":false}\n");
    expectAnswer(osutils({"user", "home", "ann"}), "USER  HOME\nann   /srv/ann\n");
    expectAnswer(osutils({"user", "home", "--json", "bob"}),
                 "{\"user\":\"bob\",\"home\":\"/home/bob\"}\n");
    expectAnswer(osutils({"user", "group", "--json", "ann"}),
                 "{\"user\":\"ann\",\"group\":\"staff\"}\n");
  });
}

TEST(Accounts, ReportsAnUnknownUserAndAGroupWithoutAName) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    for (const std::string command : {"home", "group"}) {
      for (const std::string name : {"", "Ann", "a\033b"}) {
        SCOPED_TRACE(command + name);
        expectFailure(osutils({"user", command, name}),
                      "osutils: user " + command + ": no such object (32): there is no user \"" +
                          (name == "a\033b" ? "a?b" : name) + "\"\n");
      }
    }
    expectFailure(osutils({"user", "group", "bob"}),
                  "osutils: user group: no such object (32): the primary group of \"bob\" is 6999, "
                  "which has no name\n");
  });
}

TEST(Accounts, AnswersQuestionsAboutGroups) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    expectAnswer(osutils({"group", "exists", "staff"}), "GROUP  EXISTS\nstaff  true\n");
    expectNo(osutils({"group", "exists", "--json", "crew"}),
             "{\"group\":\"crew\",\"exists\":false}\n");
    expectAnswer(osutils({"group", "members", "staff"}), "MEMBER\nbob\nZoe\n");
    expectAnswer(osutils({"group", "members", "--json", "staff"}),
                 "[{\"member\":\"bob\"},{\"member\":\"Zoe\"}]\n");
    expectAnswer(osutils({"group", "members", "empty"}), "");
    expectAnswer(osutils({"group", "members", "--json", "empty"}), "[]\n");
    expectFailure(osutils({"group", "members", "crew"}),
                  "osutils: group members: no such object (32): there is no group \"crew\"\n");
    // listed, in another case, as the primary group, and not at all
    expectAnswer(osutils({"group", "has", "staff", "bob"}),
                 "GROUP  USER  MEMBER\nstaff  bob   true\n");
    expectAnswer(osutils({"group", "has", "--json", "staff", "zoe"}),
                 "{\"group\":\"staff\",\"user\":\"zoe\",\"member\":true}\n");
    expectAnswer(osutils({"group", "has", "--json", "staff", "ann"}),
                 "{\"group\":\"staff\",\"user\":\"ann\",\"member\":true}\n");
    expectNo(osutils({"group", "has", "staff", "root"}),
             "GROUP  USER  MEMBER\nstaff  root  false\n");
    expectFailure(osutils({"group", "has", "--json", "crew", "ann"}),
                  "osutils: group has: no such object (32): there is no group \"crew\"\n");
  });
}

TEST(Accounts, ValidTriesTheAccountOutAsRoot) {
  REQUIRE_ROOT("to have accounts of its own");
  if (access("/bin/su", X_OK) != 0) GTEST_SKIP() << "needs /bin/su";
  withAccounts([] {
    for (const char* const logs : {"/run", "/var/log"}) {  // where su would log
      ASSERT_EQ(mount("osutils-test", logs, "tmpfs", 0, "mode=0755"), 0) << logs;
    }
    expectAnswer(osutils({"user", "valid", "ann"}), "USER  CODE\nann   0\n");
    expectFailure(osutils({"user", "valid", "locked"}),
                  "osutils: user valid: invalid credentials (49): \"locked\" is no valid user\n");
    expectFailure(osutils({"user", "valid", "--json", "zoe"}),
                  "osutils: user valid: no such object (32): \"zoe\" is no valid user\n");
    expectFailure(osutils({"user", "valid", "ann;true"}),
                  "osutils: user valid: parameter error (89): \"ann;true\" is no valid user\n");
  });
}

TEST(Accounts, ValidRefusesANameThatAShellWouldNotTakeAsItStands) {
  for (const std::string name : {"", "ann b", "ann\tb", "#ann", "-h", "ann --help"}) {
    SCOPED_TRACE(name);
    std::string shown = name;
    std::replace(shown.begin(), shown.end(), '\t', '?');
    expectFailure(osutils({"user", "valid", "--", name}),
                  "osutils: user valid: parameter error (89): a shell would not take the name as "
                  "it stands: \"" +
                      shown + "\"\n");
  }
}

TEST(Accounts, ForAnotherUserAnAccountThatExistsIsValid) {
  REQUIRE_OTHER_USERS();
  withAccounts([] {
    asNobody([] {
      expectAnswer(osutils({"user", "valid", "--json", "locked"}, dropCoverageCounters),
                   "{\"user\":\"locked\",\"code\":0}\n");
      expectFailure(osutils({"user", "valid", "zoe"}, dropCoverageCounters),
                    "osutils: user valid: no such object (32): \"zoe\" is no valid user\n");
    });
  });
}

// ---- Names, screening and time ----

TEST(Checks, NameCheckAnswersYesAndNo) {
  expectAnswer(osutils({"name", "check", "inst_1"}), "NAME    VALID\ninst_1  true\n");
  for (const std::string name : {"", "1inst", "inst12345", "in-st", "SQLdb", "public"}) {
    SCOPED_TRACE(name);
    expectNo(osutils({"name", "check", "--json", name}),
             R"({"name":")" + name + R"(","valid":false})" + "\n");
  }
}

TEST(Checks, ScreenAnswersForEachTextAndFailsForOne) {
  expectAnswer(osutils({"screen", "plain", "two words", "#", ""}),
               "TEXT       PASSES\nplain      true\ntwo words  true\n#          true\n"
               "           true\n");
  expectNo(osutils({"screen", "--json", "plain", "a;b", "time"}),
           R"([{"text":"plain","passes":true},{"text":"a;b","passes":false},)"
           R"({"text":"time","passes":true}])"
           "\n");
}

TEST(Checks, ScreenTakesEveryTextAsItStands) {
  for (const std::string text :
       {"[]", "[a]", "[a,b]", "{}", "a;b", "[", "a]", "$x", "a\\b", "a\nb"}) {
    SCOPED_TRACE(text);
    const Result result = osutils({"screen", "--json", text});
    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(nlohmann::json::parse(result.out),
              nlohmann::json::array({{{"text", text}, {"passes", false}}}));
  }
  expectAnswer(
      osutils({"screen", "%%", "a,b", "screen", "--", "-x", "--json", "--", "--help"}),
      "TEXT    PASSES\n%%      true\na,b     true\nscreen  true\n--      true\n-x      true\n"
      "--json  true\n--      true\n--help  true\n");
}

TEST(Checks, ScreenTakesManyTexts) {
  Arguments arguments(2001, "text");
  arguments.front() = "screen";
  const Result result = osutils(arguments);
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(std::count(result.out.begin(), result.out.end(), '\n'), 2001);
}

TEST(Checks, TimeShowsTheStampInTheZoneOfTheEnvironment) {
  const auto in = [](const char* zone) { return [zone] { setenv("TZ", zone, 1); }; };
  const Result full = osutils({"time"}, in("EST5"));
  EXPECT_EQ(full.status, 0);
  EXPECT_TRUE(std::regex_match(
      full.out, std::regex(R"(TIME\n\d{4}-\d\d-\d\d-\d\d:\d\d:\d\d\.\d{3}-05:00\n)")))
      << full.out;
  const Result compact = osutils({"time", "--compact", "--json"}, in("UTC0"));
  EXPECT_EQ(compact.status, 0);
  EXPECT_TRUE(
      std::regex_match(compact.out, std::regex(R"(\{"time":"\d{4}y\d\dy\d\dy\d\dy\d\dy\d\d"\}\n)")))
      << compact.out;
}

// ---- The inittab file ----

class Inittab : public Tool {
 protected:
  // Runs `osutils inittab COMMAND…` on the test's own file.
  Result inittab(
      Arguments arguments, const std::function<void()>& prepare = [] {}) const {
    arguments.insert(arguments.begin(), "inittab");
    arguments.insert(arguments.begin() + 2, {"--file", table});
    return osutils(std::move(arguments), prepare);
  }

  const std::string table = temp.file("inittab", kInittab);
};

std::string entry(const std::string& id, const std::string& runlevels, const std::string& action,
                  const std::string& process) {
  return R"({"id":")" + id + R"(","runlevels":")" + runlevels + R"(","action":")" + action +
         R"(","process":")" + process + "\"}";
}

TEST_F(Inittab, ListsTheEntriesInTheOrderOfTheFile) {
  expectAnswer(inittab({"list"}),
               "ID    RUNLEVELS  ACTION       PROCESS\n"
               "id    2          initdefault  \n"
               "l0    0          wait         /etc/init.d/rc 0\n"
               "vra0  2345       respawn      /opt/a:b --x\n"
               "l0    6          wait         /etc/init.d/rc 6\n");
  expectAnswer(inittab({"list", "--json"}), "[" + entry("id", "2", "initdefault", "") + "," +
                                                entry("l0", "0", "wait", "/etc/init.d/rc 0") + "," +
                                                entry("vra0", "2345", "respawn", "/opt/a:b --x") +
                                                "," + entry("l0", "6", "wait", "/etc/init.d/rc 6") +
                                                "]\n");
}

TEST_F(Inittab, ListsNothingOfAFileWithoutEntries) {
  for (const char* contents : {"", "\n", "#id:2:wait:x\n", ":id\n"}) {
    SCOPED_TRACE(contents);
    writeFile(table, contents);
    expectAnswer(inittab({"list"}), "");
    expectAnswer(inittab({"list", "--json"}), "[]\n");
  }
}

TEST_F(Inittab, ListShowsAFieldThatFillsItsPlace) {
  writeFile(table, "0123456789:abcdefghij:" + std::string(30, 'z') + ":" + std::string(300, 'p'));
  expectAnswer(
      inittab({"list", "--json"}),
      "[" + entry("0123456789", "abcdefghij", std::string(30, 'z'), std::string(256, 'p')) + "]\n");
}

TEST_F(Inittab, AddAppendsTheLineAndShowsIt) {
  expectAnswer(inittab({"add", "vra1", "2345", "respawn", "/x y:z"}),
               "ID    RUNLEVELS  ACTION   PROCESS\nvra1  2345       respawn  /x y:z\n");
  const std::string nine(9, '9');
  const std::string action(29, 'a');
  const std::string process(256, 'p');
  expectAnswer(inittab({"add", "--json", "--force", nine, nine, action, process}),
               entry(nine, nine, action, process) + "\n");
  expectAnswer(inittab({"add", "--json", "--force", "e", "", "", ""}),
               entry("e", "", "", "") + "\n");
  EXPECT_EQ(contentsOf(table), std::string(kInittab) + "vra1:2345:respawn:/x y:z\n" + nine + ":" +
                                   nine + ":" + action + ":" + process + "\ne:::\n");
}

TEST_F(Inittab, DeleteRemovesEveryLineOfTheIdAndLeavesNoBackup) {
  expectAnswer(inittab({"delete", "l0"}), "DELETED\nl0\n");
  expectAnswer(inittab({"delete", "--json", "id"}), "{\"deleted\":\"id\"}\n");
  EXPECT_EQ(contentsOf(table), "# inittab of the test\nvra0:2345:respawn:/opt/a:b --x\n");
  EXPECT_FALSE(pathExists(table + ".vrasave"));
}

TEST_F(Inittab, DeleteKeepsItsCopyAtTheBackupPath) {
  const std::string blocked = temp.dir("inittab.vrasave");  // the default path cannot be used
  const std::string copy = temp.path("copy");
  expectFailure(inittab({"delete", "id"}),
                "osutils: inittab delete: unwilling to perform (53): the backup path " + blocked +
                    " is taken by a directory\n");
  expectAnswer(inittab({"delete", "--backup", copy, "id"}), "DELETED\nid\n");
  EXPECT_FALSE(pathExists(copy));
  EXPECT_TRUE(pathExists(blocked));
}

TEST_F(Inittab, FindsTheFirstEntryByAnyPartOfItsCommand) {
  expectAnswer(inittab({"find", "/rc"}),
               "ID  RUNLEVELS  ACTION  PROCESS\nl0  0          wait    /etc/init.d/rc 0\n");
  expectAnswer(inittab({"find", "--json", "rc 6"}),
               entry("l0", "6", "wait", "/etc/init.d/rc 6") + "\n");
  expectAnswer(inittab({"find", "--json", ""}), entry("id", "2", "initdefault", "") + "\n");
  expectFailure(inittab({"find", "respawn"}),
                "osutils: inittab find: no such object (32): " + table +
                    " has no entry whose command has \"respawn\"\n");
}

TEST_F(Inittab, FindsAFreeId) {
  expectAnswer(inittab({"free-id"}), "ID\nvra1\n");
  writeFile(table, "");
  expectAnswer(inittab({"free-id", "--json"}), "{\"id\":\"vra0\"}\n");
  std::string all;
  for (const char c : std::string("0123456789abcdefghijklmnopqrstuvwxyz")) {
    all += std::string("vra") + c + ":2:off:\n";
  }
  writeFile(table, all);
  expectFailure(inittab({"free-id"}),
                "osutils: inittab free-id: unavailable (52): all ids that begin with vra are taken "
                "in " +
                    table + "\n");
}

TEST_F(Inittab, EveryCommandReportsAFileThatCannotBeLoaded) {
  const std::string fifo = temp.path("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  const std::string missing = temp.path("missing");
  const std::pair<std::string, std::string> cases[] = {
      {missing, "no such object (32): cannot read " + missing},
      {"", "no such object (32): cannot read "},
      {temp.path(), "constraint violation (19): cannot read " + temp.path()},
      {fifo, "unwilling to perform (53): " + fifo + " is not a regular file"},
  };
  const std::vector<Arguments> commands = {
      {"list"}, {"add", "a", "2", "wait", "x"}, {"delete", "id"}, {"find", "x"}, {"free-id"}};
  for (const auto& [path, result] : cases) {
    for (Arguments command : commands) {
      SCOPED_TRACE(path + " " + command[0]);
      const std::string line = "osutils: inittab " + command[0] + ": " + result + "\n";
      command.insert(command.begin(), "inittab");
      command.insert(command.begin() + 2, {"--json", "--file", path});
      expectFailure(osutils(command), line);
    }
  }
  EXPECT_FALSE(pathExists(missing));
}

TEST_F(Inittab, ReportsWhatTheEditorRefuses) {
  expectFailure(inittab({"add", "l0", "2", "wait", "x"}),
                "osutils: inittab add: already exists (68): " + table + " has an entry \"l0\"\n");
  for (const std::string id : {"L0", "", "l0:0"}) {
    expectFailure(inittab({"delete", id}), "osutils: inittab delete: no such object (32): " +
                                               table + " has no entry \"" + id + "\"\n");
  }
  EXPECT_EQ(contentsOf(table), kInittab);
}

TEST_F(Inittab, AddRefusesWhatCouldNotBeReadBack) {
  const std::string add = "osutils: inittab add: parameter error (89): ";
  for (const std::string id : {"", "#a", " a", "_", "\303\244"}) {
    SCOPED_TRACE(id);
    expectFailure(inittab({"add", id, "2", "wait", "x"}),
                  add + "ID must begin with a letter or a digit: \"" + id + "\"\n");
  }
  const std::string fields[] = {"ID", "RUNLEVELS", "ACTION", "PROCESS"};
  const size_t most[] = {9, 9, 29, 256};
  for (size_t i = 0; i < 4; ++i) {
    for (const std::string& text :
         {std::string(most[i] + 1, 'a'), std::string("a\nb"), std::string("a\033"),
          std::string("a\177"), std::string("a:b")}) {
      if (i == 3 && text == "a:b") continue;
      SCOPED_TRACE(fields[i] + text);
      Arguments arguments = {"add", "a", "2", "wait", "x"};
      arguments[i + 1] = text;
      std::string shown = text;
      std::replace_if(
          shown.begin(), shown.end(), [](char c) { return (c >= 0 && c < ' ') || c == 127; }, '?');
      expectFailure(inittab(arguments), add + fields[i] + " must have at most " +
                                            std::to_string(most[i]) + " characters, " +
                                            (i == 3 ? "" : "no colons and ") +
                                            "no control characters: \"" + shown + "\"\n");
    }
  }
  EXPECT_EQ(contentsOf(table), kInittab);
}

TEST_F(Inittab, AddRefusesAFileWhoseLastLineIsIncomplete) {
  writeFile(table, "id:2:wait:x");
  expectFailure(inittab({"add", "a", "2", "wait", "x"}),
                "osutils: inittab add: unwilling to perform (53): the last line of " + table +
                    " has no newline, the new one would join it\n");
  EXPECT_EQ(contentsOf(table), "id:2:wait:x");
}

TEST_F(Inittab, ReportsADeletionThatRemovedNoLine) {
  // An id that fills its place reads on in the record, but not in the line.
  const std::string contents = "abcdefghij:2:wait:/x\n";
  writeFile(table, contents);
  expectFailure(inittab({"delete", "abcdefghij2"}),
                "osutils: inittab delete: unwilling to perform (53): no line of " + table +
                    " has the whole id \"abcdefghij2\"\n");
  EXPECT_EQ(contentsOf(table), contents);
}

TEST_F(Inittab, WorksOnTheSystemsFileByDefault) {
  REQUIRE_ROOT("to put another file in the place of /etc/inittab");
  EXPECT_EQ(withPrivateEtc([] {
              writeFile("/etc/inittab", kInittab);
              EXPECT_EQ(osutils({"inittab", "add", "a", "2", "wait", "x"}).status, 0);
              EXPECT_EQ(contentsOf("/etc/inittab"), std::string(kInittab) + "a:2:wait:x\n");
              expectAnswer(osutils({"inittab", "delete", "a"}), "DELETED\na\n");
              EXPECT_EQ(contentsOf("/etc/inittab"), kInittab);
              EXPECT_FALSE(pathExists("/etc/inittab.vrasave"));
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

// ---- Processes, platform and modules ----

class Processes : public Tool {
 protected:
  // A launcher that does this.
  void makeLauncher(const std::string& script) const {
    writeFile(launcher, "#!/bin/sh\n" + script + "\n");
    ASSERT_EQ(chmod(launcher.c_str(), 0755), 0);
  }
  Result start(Arguments arguments) const {
    arguments.insert(arguments.begin(), {"process", "start", "--launcher-dir", temp.path()});
    return osutils(arguments);
  }

  const std::string launcher = temp.path("vrarun");
  const std::string written = temp.path("written");
};

// A child that waits until it is ended, at the latest by the end of the scope.
class Sleeper {
 public:
  Sleeper() : pid_(fork()) {
    if (pid_ == 0) {
      execl("/bin/sleep", "sleep", "600", nullptr);
      _exit(126);
    }
  }
  ~Sleeper() { (void)end(); }
  Sleeper(const Sleeper&) = delete;
  Sleeper& operator=(const Sleeper&) = delete;

  std::string pid() const { return std::to_string(pid_); }
  bool runs() const { return waitpid(pid_, nullptr, WNOHANG) == 0; }
  // The status that it ended with; ends it when nobody has.
  int end() {
    if (pid_ <= 0) return -1;
    int status = -1;
    if (waitpid(pid_, &status, WNOHANG) == 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, &status, 0);
    }
    pid_ = -1;
    return status;
  }

 private:
  pid_t pid_;
};

TEST_F(Processes, StartRunsTheLauncherWithTheArguments) {
  makeLauncher("echo noise; printf '%s\\n' \"$@\" > " + written);
  expectAnswer(start({"inst1", "a,b", "%%"}), "LAUNCHER" + std::string(launcher.size() - 6, ' ') +
                                                  "ARGUMENTS\n" + launcher + "  inst1 a,b %%\n");
  EXPECT_EQ(contentsOf(written), "inst1\na,b\n%%\n");
  expectAnswer(
      start({"--json", "stop", "-I", "--", "inst1", "--json"}),
      R"({"launcher":")" + launcher + R"(","arguments":"stop -I -- inst1 --json"})" + "\n");
  EXPECT_EQ(contentsOf(written), "stop\n-I\n--\ninst1\n--json\n");
}

TEST_F(Processes, WhatIsStartedIgnoresNotWhatTheToolDoes) {
  makeLauncher("sed -n 's/^SigIgn:/0x/p' /proc/self/status | tr -d '\\t' > " + written);
  EXPECT_EQ(start({"inst1"}).status, 0);
  const unsigned long ignored = strtoul(contentsOf(written).c_str(), nullptr, 16);
  EXPECT_EQ(ignored & (1UL << (SIGPIPE - 1) | 1UL << (SIGXFSZ - 1)), 0U);
}

TEST_F(Processes, StartTakesTheInstalledLauncherByDefault) {
  const std::string root = temp.dir("root");
  temp.dir("root/sbin");
  const std::string directory = temp.dir("root/sbin/64");
  makeLauncher("echo $1 > " + written);
  ASSERT_EQ(rename(launcher.c_str(), (directory + "/vrarun").c_str()), 0);
  expectAnswer(osutils({"process", "start", "--json", "a"},
                       [&] { setenv("VRA_LDAP_HOME", root.c_str(), 1); }),
               R"({"launcher":")" + directory + R"(/vrarun","arguments":"a"})" + "\n");
  EXPECT_EQ(contentsOf(written), "a\n");
}

TEST_F(Processes, StartReportsHowTheLauncherEnded) {
  const std::string failed =
      "osutils: process start: operations error (1): " + launcher + " ended with ";
  expectFailure(start({"a"}), failed + "127\n");  // there is none
  makeLauncher("exit 3");
  expectFailure(start({"a", "--json"}), failed + "3\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0644), 0);
  expectFailure(start({"a"}), failed + "126\n");
  // The shell may run the launcher in its own place, and then ends as that does.
  makeLauncher("kill -9 $$");
  expectFailure(start({"a"}), ::testing::AnyOf(failed + "137\n",
                                               "osutils: process start: operations error (1): " +
                                                   launcher + " was ended by signal 9\n"));
}

TEST_F(Processes, StartRefusesWhatAShellWouldNotTakeAsItStands) {
  makeLauncher("touch " + written);
  const std::string refused = "osutils: process start: parameter error (89): ";
  for (const std::string argument : {"", "a b", "a\tb", "#", "#a"}) {
    SCOPED_TRACE(argument);
    std::string shown = argument;
    std::replace(shown.begin(), shown.end(), '\t', '?');
    expectFailure(
        start({"a", argument}),
        refused + "a shell would not take the argument as it stands: \"" + shown + "\"\n");
  }
  for (const std::string argument : {"a;b", "$a", "`a`", "[a,b]", "a>b", "a\\b", "'", "a\nb"}) {
    SCOPED_TRACE(argument);
    std::string shown = argument;
    std::replace(shown.begin(), shown.end(), '\n', '?');
    expectFailure(start({argument}),
                  refused + "cannot start with the arguments \"" + shown + "\"\n");
  }
  for (const std::string directory : {"", "a=b", "a#b", "a b", "a;b", "$HOME"}) {
    SCOPED_TRACE(directory);
    expectFailure(
        osutils({"process", "start", "--launcher-dir", directory, "a"}),
        refused + "a shell would not take the directory as it stands: \"" + directory + "\"\n");
  }
  EXPECT_FALSE(pathExists(written));
}

TEST_F(Processes, StopEndsAProcess) {
  Sleeper table;
  Sleeper json;
  expectAnswer(osutils({"process", "stop", table.pid()}), "STOPPED\n" + table.pid() + "\n");
  expectAnswer(osutils({"process", "stop", "--json", json.pid()}),
               "{\"stopped\":\"" + json.pid() + "\"}\n");
  for (Sleeper* const sleeper : {&table, &json}) {
    const int status = sleeper->end();
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(WTERMSIG(status), SIGKILL);
  }
}

TEST_F(Processes, StopReportsAProcessThatIsNotThere) {
  const std::string pid = std::to_string(kNoProcess);
  expectFailure(osutils({"process", "stop", pid}),
                "osutils: process stop: operations error (1): cannot stop process " + pid + "\n");
}

// Only text that the tool refuses before it calls the library.
TEST_F(Processes, OnlyAPositiveNumberIsAProcess) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    for (const std::string pid :
         {"0", "-0", "-1", "abc", "1x", "", " 1", "+1", "0x1", "99999999999", "2147483648"}) {
      SCOPED_TRACE(pid);
      for (const std::string command : {"stop", "status"}) {
        Arguments arguments = {"process", command, "--", pid};
        if (command == "status") arguments.push_back("sleep");
        expectFailure(osutils(arguments), "osutils: process " + command +
                                              ": parameter error (89): PID is not the number of a "
                                              "process: \"" +
                                              pid + "\"\n");
      }
    }
  });
}

TEST_F(Processes, StatusAnswersYesAndNo) {
  if (runProgram({"/usr/bin/env", "ps", "-e"}).status != 0) GTEST_SKIP() << "needs ps";
  const Sleeper sleeper;
  // the child has its name once it runs the other program
  const std::string name = "/proc/" + sleeper.pid() + "/comm";
  while (contentsOf(name) != "sleep\n" && sleeper.runs()) usleep(1000);
  expectAnswer(osutils({"process", "status", "--json", sleeper.pid(), "sleep"}),
               R"({"pid":")" + sleeper.pid() + R"(","program":"sleep","started":true})" + "\n");
  expectNo(osutils({"process", "status", sleeper.pid(), "no-such-one"}),
           "PID" + std::string(std::max(sleeper.pid().size(), size_t{3}) - 1, ' ') +
               "PROGRAM      STARTED\n" + sleeper.pid() +
               std::string(sleeper.pid().size() < 3 ? 5 - sleeper.pid().size() : 2, ' ') +
               "no-such-one  false\n");
  EXPECT_TRUE(sleeper.runs());
}

TEST_F(Processes, StatusRefusesANameThatAShellWouldNotTakeAsItStands) {
  for (const std::string program : {"", "-v", "a b", "#", "a;b", "a.*"}) {
    SCOPED_TRACE(program);
    expectFailure(osutils({"process", "status", "1", program}),
                  "osutils: process status: parameter error (89): a shell would not take the "
                  "program's name as it stands: \"" +
                      program + "\"\n");
  }
}

TEST(Platform, ShowsTheSystemAndTheThreadLibrary) {
  const bool nptl =
      runProgram({"/usr/bin/env", "getconf", "GNU_LIBPTHREAD_VERSION"}).out.find("NPTL") !=
      std::string::npos;
  const std::string answer = nptl ? "true" : "false";
  expectAnswer(osutils({"platform"}), "OS         NPTL\nLinux-x64  " + answer + "\n");
  expectAnswer(osutils({"platform", "--json"}), R"({"os":"Linux-x64","nptl":)" + answer + "}\n");
}

TEST_F(Tool, ModuleCheckLoadsALibraryAndFindsItsSymbols) {
  std::string library = OSUTILS_TOOL;
  library.replace(library.rfind("/bin/"), std::string::npos, "/lib/osutils/libtrc.so");
  if (!pathExists(library)) GTEST_SKIP() << "the trace library is not one of the build's";
  expectAnswer(osutils({"module", "check", library}), "FILE\n" + library + "\n");
  expectAnswer(osutils({"module", "check", "--json", library, "trcInit"}),
               R"({"file":")" + library + R"(","symbol":"trcInit"})" + "\n");
  for (const std::string symbol : {"no_such_symbol", ""}) {
    expectFailure(osutils({"module", "check", library, symbol}),
                  "osutils: module check: no such object (32): " + library + " has no symbol \"" +
                      symbol + "\"\n");
  }
}

TEST_F(Tool, ModuleCheckReportsWhatIsNoLibrary) {
  const std::string failed = "osutils: module check: operations error (1): cannot load ";
  for (const std::string& path : {temp.path("missing"), file, temp.path()}) {
    SCOPED_TRACE(path);
    expectFailure(osutils({"module", "check", path}), StartsWith(failed + path + ": "));
    expectFailure(osutils({"module", "check", "--json", path, "trcInit"}),
                  StartsWith(failed + path + ": "));
  }
  expectFailure(osutils({"module", "check", ""}),
                "osutils: module check: parameter error (89): FILE is empty\n");
}

// ---- Addresses ----

// Runs the body with these hosts, under the host name "thishost", without any network.
void withHosts(const std::string& hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateNetwork([&] {
              EXPECT_EQ(sethostname("thishost", 8), 0);
              writeFile("/etc/host.conf", "multi on\n");
              writeFile("/etc/hosts", hosts);
              body();
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(Addresses, ListsThoseOfThisHostsNameAndOfLocalhost) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 thishost\n10.1.2.4 localhost\n10.1.2.5 localhost\n", [] {
    expectAnswer(osutils({"net", "addresses"}), "ADDRESS\n10.1.2.3\n");
    expectAnswer(osutils({"net", "addresses", "--json"}), "[{\"address\":\"10.1.2.3\"}]\n");
    const Result localhost = osutils({"net", "addresses", "--localhost", "--json"});
    EXPECT_EQ(localhost.status, 0);
    const auto answer = nlohmann::json::parse(localhost.out);
    std::vector<std::string> addresses;
    for (const auto& each : answer) addresses.push_back(each["address"]);
    EXPECT_THAT(addresses, ::testing::UnorderedElementsAre("10.1.2.4", "10.1.2.5"));
    // no interface has one
    expectAnswer(osutils({"net", "addresses", "--interfaces"}), "");
    expectAnswer(osutils({"net", "addresses", "--interfaces", "--json"}), "[]\n");
  });
}

TEST(Addresses, AnUnknownNameIsAFailure) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 another\n", [] {
    const std::string unknown = "Name or service not known\n";
    for (const Arguments& command :
         {Arguments{"net", "addresses"}, Arguments{"net", "check", "10.1.2.3"}}) {
      expectFailure(
          osutils(command),
          "osutils: " + command[0] + " " + command[1] +
              ": operations error (1): cannot list the addresses of this host's name: " + unknown);
    }
  });
}

TEST(Addresses, CheckAnswersYesAndNo) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("2001:db8::1f thishost\n", [] {
    expectAnswer(osutils({"net", "check", "2001:DB8::1F"}),
                 "ADDRESS       LOCAL\n2001:DB8::1F  true\n");
    for (const std::string address : {"10.1.2.4", "", "thishost", "2001:db8::1"}) {
      SCOPED_TRACE(address);
      expectNo(osutils({"net", "check", "--json", address}),
               R"({"address":")" + address + R"(","local":false})" + "\n");
    }
  });
}

// Gives an interface an IPv4 address. "lo:1" is an alias of the loopback, made by this.
void setAddress(const char* interface, const char* address) {
  ifreq request = {};
  strcpy(request.ifr_name, interface);
  sockaddr_in socket_address = {};
  socket_address.sin_family = AF_INET;
  ASSERT_EQ(inet_pton(AF_INET, address, &socket_address.sin_addr), 1) << address;
  memcpy(&request.ifr_addr, &socket_address, sizeof socket_address);
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  EXPECT_EQ(ioctl(descriptor, SIOCSIFADDR, &request), 0) << interface << ": " << strerror(errno);
  close(descriptor);
}

TEST(Addresses, ListsThoseOfTheInterfacesWithoutTheLoopbacks) {
  REQUIRE_ROOT("to have a network of its own");
  withHosts("10.1.2.3 thishost\n", [] {
    setAddress("lo", "127.0.0.1");
    setAddress("lo:1", "10.9.8.7");
    setAddress("lo:2", "10.9.8.6");
    expectAnswer(osutils({"net", "addresses", "--interfaces"}), "ADDRESS\n10.9.8.7\n10.9.8.6\n");
    expectAnswer(osutils({"net", "addresses", "--interfaces", "--json"}),
                 R"([{"address":"10.9.8.7"},{"address":"10.9.8.6"}])"
                 "\n");
    expectAnswer(osutils({"net", "check", "10.9.8.6"}), "ADDRESS   LOCAL\n10.9.8.6  true\n");
    expectNo(osutils({"net", "check", "127.0.0.1"}), "ADDRESS    LOCAL\n127.0.0.1  false\n");
  });
}

TEST(Addresses, InterfacesThatCannotBeListedAreAFailure) {
  REQUIRE_ROOT("to have hosts of its own");
  if (prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, nullptr) == -1 && errno != EFAULT) {
    GTEST_SKIP() << "the system cannot let system calls fail";
  }
  const auto without_sockets = [] { failSystemCall(SYS_socket, 0, AF_INET6, EAFNOSUPPORT); };
  const auto without_list = [] { failSystemCall(SYS_ioctl, 1, SIOCGIFCONF, ENOTTY); };
  struct Case {
    std::function<void()> prepare;
    std::string reason;
  };
  const Case cases[] = {{without_sockets, "Address family not supported by protocol\n"},
                        {without_list, "Inappropriate ioctl for device\n"}};
  withHosts("10.1.2.3 thishost\n", [&] {
    for (const Case& each : cases) {
      SCOPED_TRACE(each.reason);
      const std::string failed = ": operations error (1): cannot list the interfaces: ";
      expectFailure(osutils({"net", "addresses", "--interfaces"}, each.prepare),
                    "osutils: net addresses" + failed + each.reason);
      expectFailure(osutils({"net", "check", "10.1.2.4"}, each.prepare),
                    "osutils: net check" + failed + each.reason);
      // the name has it: the interfaces do not matter
      expectAnswer(osutils({"net", "check", "--json", "10.1.2.3"}, each.prepare),
                   R"({"address":"10.1.2.3","local":true})"
                   "\n");
    }
  });
}

TEST(Addresses, ResolveListsTheAddressesOfAName) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 first alias\n10.1.2.4 first\n2001:db8::1 six\n10.1.2.5 last\n", [] {
    expectAnswer(osutils({"net", "resolve", "first"}),
                 "NAME   ADDRESS\nfirst  10.1.2.3\nfirst  10.1.2.4\n");
    expectAnswer(osutils({"net", "resolve", "--json", "alias"}),
                 R"([{"name":"first","address":"10.1.2.3"}])"
                 "\n");
    // the last line's host is what the resolver leaves behind for these
    for (const std::string name : {"unknown", "", "six"}) {
      SCOPED_TRACE(name);
      expectFailure(
          osutils({"net", "resolve", name}),
          StartsWith("osutils: net resolve: no such object (32): cannot resolve \"" + name + "\""));
    }
  });
}

// ---- Distinguished names ----

// Runs `osutils dn COMMAND…` with a file as its standard input.
Result dnOf(Arguments arguments, const std::string& input) {
  arguments.insert(arguments.begin(), "dn");
  return osutils(std::move(arguments), [&] {
    const int descriptor = open(input.c_str(), O_RDONLY | O_CLOEXEC);
    if (dup2(descriptor, STDIN_FILENO) == -1) close(STDIN_FILENO);
  });
}

TEST_F(Tool, DnFormatShowsTheCanonicalSpelling) {
  expectAnswer(osutils({"dn", "format", "cn = Ann ,o=b"}),
               "NAME           FORMATTED\ncn = Ann ,o=b  CN=ANN,O=B\n");
  expectAnswer(osutils({"dn", "format", "--json", "[a,b]"}),
               R"({"name":"[a,b]","formatted":"[A,B]"})"
               "\n");
  expectFailure(osutils({"dn", "format", ""}),
                "osutils: dn format: parameter error (89): a name is empty\n");
}

TEST_F(Tool, DnFormatTakesTheLinesOfStandardInput) {
  const std::string names = temp.file("names", "a = b\nc=d;e=f");
  expectAnswer(dnOf({"format"}, names), "NAME     FORMATTED\na = b    A=B\nc=d;e=f  C=D,E=F\n");
  expectAnswer(dnOf({"format", "--json"}, temp.file("one", "a=b\n")),
               R"([{"name":"a=b","formatted":"A=B"}])"
               "\n");
  expectAnswer(dnOf({"format"}, "/dev/null"), "");
  expectAnswer(dnOf({"format", "--json"}, temp.path("closed")), "[]\n");
}

TEST_F(Tool, DnGoesOnAfterALineThatIsNoName) {
  const std::string bad = temp.file("bad", std::string("a=b\n\nx\0y\n \t\r\nA=b", 16));
  const auto lines = [](const std::string& command) {
    const std::string line = "osutils: dn " + command + ": line ";
    return line + "2 of standard input is blank\n" + line +
           "3 of standard input has a null character\n" + line + "4 of standard input is blank\n";
  };
  const Result formatted = dnOf({"format"}, bad);
  EXPECT_EQ(formatted.status, 3);
  EXPECT_EQ(formatted.out, "NAME  FORMATTED\na=b   A=B\nA=b   A=B\n");
  EXPECT_EQ(formatted.err, lines("format"));
  const Result compared = dnOf({"compare", "--json"}, bad);
  EXPECT_EQ(compared.status, 3);
  EXPECT_EQ(compared.out, "{\"a\":\"a=b\",\"b\":\"A=b\",\"equal\":true}\n");
  EXPECT_EQ(compared.err, lines("compare"));
  EXPECT_EQ(dnOf({"compare"}, temp.file("one", "a=b\n\n")).status, 3);
}

TEST_F(Tool, DnSaysThatEscapesOfTwoHexadecimalDigitsAreNotDecoded) {
  const auto line = [](const std::string& command, const std::string& name) {
    return "osutils: dn " + command + ": escapes of two hexadecimal digits are not decoded: \"" +
           name + "\"\n";
  };
  for (const std::string name : {R"(cn=a\2Cb)", R"(cn=a\\\e4b)", R"(cn=a\fF)"}) {
    SCOPED_TRACE(name);
    const Result result = osutils({"dn", "format", name});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, line("format", name));
    EXPECT_EQ(osutils({"dn", "format", "--quiet", name}).err, "");
    EXPECT_EQ(dnOf({"format"}, temp.file("names", name + "\na=b\n" + name)).err,
              line("format", name) + line("format", name));
    const Result compared = osutils({"dn", "compare", name, name});
    EXPECT_EQ(compared.status, 0);
    EXPECT_EQ(compared.err, line("compare", name) + line("compare", name));
    EXPECT_EQ(osutils({"dn", "compare", "--quiet", name, name}).err, "");
  }
  for (const std::string name : {R"(cn=a\,b)", R"(cn=a\\2Cb)", R"(cn=a\2)", R"(cn=a\2G)", "2C"}) {
    SCOPED_TRACE(name);
    EXPECT_EQ(osutils({"dn", "format", name}).err, "");
  }
}

TEST_F(Tool, DnHelpSaysWhatItDoesNotKnow) {
  for (const std::string command : {"format", "compare"}) {
    EXPECT_THAT(osutils({"dn", command, "--help"}).out,
                AllOf(HasSubstr("escapes of two hexadecimal digits"), HasSubstr("joined by \"+\""),
                      HasSubstr("synonyms"), HasSubstr("they are ASCII"), HasSubstr("--quiet")));
  }
  // as it says
  for (const auto& [a, b] :
       {std::pair(R"(cn=a\2Cb)", R"(cn=a\,b)"), std::pair("cn=a+sn=b", "sn=b+cn=a"),
        std::pair("cn=a", "commonName=a"), std::pair("cn=\303\251", "cn=\303\211")}) {
    EXPECT_EQ(osutils({"dn", "compare", "--quiet", a, b}).status, 1) << a;
  }
}

TEST_F(Tool, DnCompareAnswersYesAndNo) {
  expectAnswer(osutils({"dn", "compare", "a=b", "A = B"}), "A    B      EQUAL\na=b  A = B  true\n");
  expectNo(osutils({"dn", "compare", "--json", "a=b", "a=c"}),
           R"({"a":"a=b","b":"a=c","equal":false})"
           "\n");
  expectNo(osutils({"dn", "compare", "--json", "", ""}), R"({"a":"","b":"","equal":false})"
                                                         "\n");
}

TEST_F(Tool, DnCompareTakesTheTwoLinesOfStandardInput) {
  expectAnswer(dnOf({"compare", "--json"}, temp.file("two", "a=b\nA= b")),
               R"({"a":"a=b","b":"A= b","equal":true})"
               "\n");
  expectNo(dnOf({"compare"}, temp.file("other", "a=b\na=c\n")),
           "A    B    EQUAL\na=b  a=c  false\n");
  const std::string wrong[] = {"", "a=b\n", "a\nb\nc\n"};
  const std::string counts[] = {"0", "1", "3"};
  for (size_t i = 0; i < 3; ++i) {
    expectFailure(dnOf({"compare"}, temp.file("wrong", wrong[i])),
                  "osutils: dn compare: parameter error (89): two names are compared, not " +
                      counts[i] + "\n");
  }
}

TEST_F(Tool, DnReportsInputThatItCannotTake) {
  for (const std::string command : {"format", "compare"}) {
    SCOPED_TRACE(command);
    expectFailure(
        dnOf({command}, temp.path()),
        "osutils: dn " + command + ": operations error (1): cannot read standard input\n");
  }
}

// ---- All of them ----

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

struct Command {
  Arguments name;
  int arguments;
};
const Command kCommands[] = {
    {{"paths"}, 0},
    {{"db"}, 0},
    {{"file", "stat"}, 1},
    {{"file", "check"}, 1},
    {{"file", "copy"}, 2},
    {{"file", "create"}, 1},
    {{"file", "delete"}, 1},
    {{"file", "clear"}, 1},
    {{"file", "owner"}, 1},
    {{"dir", "create"}, 1},
    {{"dir", "delete"}, 1},
    {{"dir", "trim"}, 1},
    {{"space"}, 2},
    {{"user", "exists"}, 1},
    {{"user", "valid"}, 1},
    {{"user", "home"}, 1},
    {{"user", "group"}, 1},
    {{"group", "exists"}, 1},
    {{"group", "members"}, 1},
    {{"group", "has"}, 2},
    {{"name", "check"}, 1},
    {{"time"}, 0},
    {{"inittab", "list"}, 0},
    {{"inittab", "add"}, 4},
    {{"inittab", "delete"}, 1},
    {{"inittab", "find"}, 1},
    {{"inittab", "free-id"}, 0},
    {{"process", "stop"}, 1},
    {{"process", "status"}, 2},
    {{"platform"}, 0},
    {{"net", "addresses"}, 0},
    {{"net", "check"}, 1},
    {{"net", "resolve"}, 1},
};

TEST_F(Tool, EveryCommandWantsExactlyItsArguments) {
  for (const Command& command : kCommands) {
    std::string line = "osutils:";
    for (const std::string& word : command.name) line += " " + word;
    line += ": parameter error (89): ";
    SCOPED_TRACE(line);
    Arguments arguments = command.name;
    for (int count = 0; count <= command.arguments; ++count) {
      if (count != command.arguments) expectFailure(osutils(arguments), StartsWith(line));
      arguments.push_back(temp.path("missing"));
    }
    expectFailure(osutils(arguments), StartsWith(line));
    arguments.pop_back();
    arguments.push_back("--unknown");
    expectFailure(osutils(arguments), StartsWith(line));
  }
  expectFailure(osutils({"screen"}), StartsWith("osutils: screen: parameter error (89): "));
  expectFailure(osutils({"screen", "--unknown", "a"}),
                StartsWith("osutils: screen: parameter error (89): "));
  for (const Arguments& arguments :
       {Arguments{"process", "start"}, Arguments{"process", "start", "--unknown", "a"},
        Arguments{"process", "start", "--launcher-dir", "a"}, Arguments{"module", "check"},
        Arguments{"module", "check", "a", "b", "c"}, Arguments{"module", "check", "--unknown", "a"},
        Arguments{"dn", "format", "a", "b"}, Arguments{"dn", "format", "--unknown"},
        Arguments{"dn", "compare", "a"}, Arguments{"dn", "compare", "a", "b", "c"},
        Arguments{"net", "addresses", "--localhost", "--interfaces"}}) {
    SCOPED_TRACE(::testing::PrintToString(arguments));
    expectFailure(osutils(arguments), StartsWith("osutils: " + arguments[0] + " " + arguments[1] +
                                                 ": parameter error (89): "));
  }
  for (const std::string family :
       {"file", "dir", "user", "group", "name", "inittab", "process", "module", "net", "dn"}) {
    SCOPED_TRACE(family);
    expectFailure(osutils({family}), StartsWith("osutils: " + family + ": parameter error (89): "));
    expectFailure(osutils({family, "unknown"}),
                  StartsWith("osutils: " + family + ": parameter error (89): "));
  }
  for (const Arguments& arguments :
       {Arguments{"db", "--instance", "a"}, Arguments{"db", "--location", "b"},
        Arguments{"db", "--instance", "a", "--location", "b", "--migration", "c"},
        Arguments{"db", "--location", "b", "--migration", "c"}, Arguments{"db", "--migration"}}) {
    SCOPED_TRACE(::testing::PrintToString(arguments));
    expectFailure(osutils(arguments), StartsWith("osutils: db: parameter error (89): "));
  }
}

TEST_F(Tool, EveryCommandExplainsItself) {
  std::vector<Command> commands(std::begin(kCommands), std::end(kCommands));
  for (const Arguments& name :
       {Arguments{"screen"}, Arguments{"process", "start"}, Arguments{"module", "check"},
        Arguments{"dn", "format"}, Arguments{"dn", "compare"}}) {
    commands.push_back({name, 1});
  }
  for (const Command& command : commands) {
    SCOPED_TRACE(::testing::PrintToString(command.name));
    Arguments arguments = command.name;
    arguments.push_back("--help");
    const Result text = osutils(arguments);
    EXPECT_EQ(text.status, 0);
    EXPECT_THAT(text.out, AllOf(HasSubstr("--json"), HasSubstr("--trace"),
                                HasSubstr("The exit status is 0")));
    EXPECT_EQ(text.err, "");
  }
  for (const Arguments& question :
       {Arguments{"space", "--help"}, Arguments{"user", "exists", "--help"},
        Arguments{"group", "exists", "--help"}, Arguments{"group", "has", "--help"},
        Arguments{"name", "check", "--help"}, Arguments{"screen", "--help"},
        Arguments{"process", "status", "--help"}, Arguments{"net", "check", "--help"},
        Arguments{"dn", "compare", "--help"}}) {
    EXPECT_THAT(osutils(question).out, HasSubstr("The exit status is 0 for yes, 1 for no, "));
  }
  EXPECT_THAT(osutils({"screen", "--help"}).out, HasSubstr("[OPTIONS] TEXT...\n"));
  EXPECT_THAT(osutils({"process", "start", "--help"}).out, HasSubstr("[OPTIONS] ARGUMENT...\n"));
  EXPECT_THAT(osutils({"inittab", "delete", "--help"}).out,
              AllOf(HasSubstr("--file"), HasSubstr("--backup"), HasSubstr("rewritten in place")));
  const std::string help = osutils({"--help"}).out;
  for (const char* command :
       {"paths", "db", "file", "dir", "space", "user", "group", "name", "screen", "time", "inittab",
        "process", "platform", "module", "net", "dn"}) {
    EXPECT_THAT(help, HasSubstr("\n  " + std::string(command) + " "));
  }
}

TEST_F(Files, TakesTheNamesOfCommandsAndBracketsAsArguments) {
  for (const std::string name : {"file", "dir", "stat", "time", "[a]", "[a,b]", "{}", "%%"}) {
    SCOPED_TRACE(name);
    const auto in_place = [this] { (void)!chdir(temp.path().c_str()); };
    expectAnswer(osutils({"file", "create", "--json", name}, in_place), owned(name, "0640"));
    EXPECT_TRUE(pathExists(temp.path(name)));
    expectAnswer(osutils({"file", "delete", name}, in_place), "DELETED\n" + name + "\n");
    expectNo(osutils({"user", "exists", "--json", name}),
             R"({"user":")" + name + R"(","exists":false})" + "\n");
  }
}

}  // namespace
