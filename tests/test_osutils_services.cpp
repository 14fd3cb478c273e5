// The commands of the family "services".
#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <net/if.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "system_call_filter.h"
#include "tool.h"
#include "tool_edits.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;

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

TEST_F(Tool, ListKnowsBlanksLettersAndDigits) {
  for (const char blank : {' ', '\t', '\v', '\f', '\r'}) {
    writeFile(file, std::string(1, blank) + "first" + blank + blank + "1/tcp\n");
    expectAnswer(services({"list"}), "NAME   PORT\nfirst  1\n");
  }
  for (const char letter : {'a', 'z', 'A', 'Z'}) {
    for (const char digit : {'0', '9'}) {
      writeFile(file, std::string(1, letter) + " " + digit + "/tcp\n");
      expectAnswer(services({"list"}),
                   std::string("NAME  PORT\n") + letter + "     " + digit + "\n");
    }
  }
  for (const char* line : {"@ 1/tcp", "[ 1/tcp", "` 1/tcp", "{ 1/tcp", "a //tcp", "a :/tcp"}) {
    writeFile(file, std::string(line) + "\nb 2/tcp\n");
    expectAnswer(services({"list"}), "NAME  PORT\nb     2\n");
  }
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
  const std::string blocked =
      temp.dir("services.vrasave");  // makes the default backup path unusable

  expectFailure(services({"delete", "ldap"}),
                "osutils: services delete: unwilling to perform (53): the backup path " + blocked +
                    " is a directory\n");
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
                                                           " is used in " + file +
                                                           " or outside 1 to 400000\n");
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
      "",        "1ldap",  "#ldap",  "_ldap",      "\303\244ldap", " ldap",
      "ld ap",   "ld\tap", "ldap\n", "l\nd 1/tcp", "ld\033p",      "ld\177p",
      "ld\037p", "@ldap",  "[ldap",  "`ldap",      "{ldap",        std::string(91, 'n')};
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

TEST_F(Tool, RefusesWhatIsNotANumber) {
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

TEST_F(Tool, AddRefusesAFileWhoseLastLineIsIncomplete) {
  writeFile(file, "ssh 22/tcp");
  expectFailure(services({"add", "vraslapd", "3700"}),
                "osutils: services add: unwilling to perform (53): the last line of " + file +
                    " has no newline: the new one would join it\n");
  EXPECT_EQ(contentsOf(file), "ssh 22/tcp");
}

TEST_F(Tool, DeleteRefusesTheFileAsItsOwnBackup) {
  expectFailure(services({"delete", "--backup", file, "ssh"}),
                "osutils: services delete: unwilling to perform (53): the backup path " + file +
                    " is the file itself\n");
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, ReportsADeletionThatRemovedNoLine) {
  const std::string contents = std::string(95, 'a') + " 7/tcp\n";
  writeFile(file, contents);
  const std::string listed(90, 'a');
  expectFailure(services({"delete", listed}),
                "osutils: services delete: unwilling to perform (53): no line of " + file +
                    " has the exact name \"" + listed + "\"\n");
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

// ---- Other readers of the file ----

class Services : public ::testing::Test {
 protected:
  Result add(const Arguments& texts, const Arguments& options = {}) const {
    Arguments rest = options;
    rest.insert(rest.end(), texts.begin(), texts.end());
    return osutils(command("services", "add", file, rest));
  }

  const TempDir temp;
  const std::string file =
      temp.file("services", std::string(kServices) + "http 80/tcp www # web\n");
};

TEST_F(Services, DeleteTellsTheLongestNameFromALongerOne) {
  const std::string name(90, 'a');
  const std::string longer = name + "b\t4001/tcp\n";
  writeFile(file, name + "\t4000/tcp\n" + longer);
  const Result result = osutils(command("services", "delete", file, {name}));
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "");
  EXPECT_EQ(contentsOf(file), longer);
}

TEST_F(Services, AddRefusesWhatOthersWouldReadOtherwise) {
  const std::string before = contentsOf(file);
  struct Case {
    Arguments texts;
    int status;
    std::string why;
  };
  const Case cases[] = {
      {{"new", "65536"}, 2, "PORT is above 65535: other programs would read it as 0"},
      {{"new", "70000"}, 2, "PORT is above 65535: other programs would read it as 4464"},
      {{"new", "400000"}, 2, "PORT is above 65535"},
      {{"ne#w", "4000"}, 2, "NAME contains \"#\" or \"/\": other programs would not find it"},
      {{"new/udp", "4000"}, 2, "NAME contains \"#\" or \"/\": other programs would not find it"},
      {{"www", "4000"},
       3,
       "other programs would find the line of \"http\" in " + file + " for \"www\""},
      {{"directory", "4000"}, 3, "other programs would find the line of \"ldap\""},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.why);
    const Result result = add(each.texts);
    EXPECT_EQ(result.status, each.status);
    EXPECT_THAT(result.err, HasSubstr(each.why));
    EXPECT_EQ(contentsOf(file), before);
    EXPECT_EQ(add(each.texts, {"--force"}).status, 0);
    EXPECT_EQ(contentsOf(file), before + each.texts[0] + "\t" + each.texts[1] + "/tcp\n");
    writeFile(file, before);
  }
  for (const Arguments& texts : {Arguments{"remote", "4000"}, Arguments{"web", "4001"}}) {
    EXPECT_EQ(add(texts).status, 0);  // words of comments
  }
}

TEST_F(Services, WhatIsAddedWithoutForceIsFoundByGetent) {
  REQUIRE_ROOT("to put another file in the place of /etc/services");
  if (!pathExists("/usr/bin/getent")) GTEST_SKIP() << "needs getent";
  const std::string contents = contentsOf(file);
  EXPECT_EQ(withPrivateEtc([&] {
              const auto portOf = [](const std::string& name) -> std::string {
                const Result found = runProgram({"/usr/bin/getent", "services", name});
                std::istringstream words(found.out);
                std::string first;
                std::string port;
                words >> first >> port;
                return first == name ? port : first;
              };
              int port = 4000;
              for (const std::string name :
                   {"a", "a.b", "a:b", "a,b", "a\\b", "a'b", "a\"b", "A", "a-", "x11", "a\303\244",
                    "a\205", "a\240", "a\377", "[a]", "a*", "a=b", "web"}) {
                SCOPED_TRACE(name);
                writeFile("/etc/services", contents);
                const std::string number = std::to_string(++port);
                const Result added = osutils({"services", "add", name, number});
                if (name == "[a]") {
                  EXPECT_EQ(added.status, 2);  // does not begin with a letter
                  continue;
                }
                EXPECT_EQ(added.status, 0) << added.err;
                EXPECT_EQ(portOf(name), number + "/tcp");
              }
              // What needs --force is not found.
              struct Case {
                std::string name;
                std::string port;
                std::string found;
              };
              const Case cases[] = {{"a#b", "4000", ""},
                                    {"a/b", "4000", ""},
                                    {"www", "4000", "http"},
                                    {"big", "70000", "4464/tcp"}};
              for (const Case& each : cases) {
                SCOPED_TRACE(each.name);
                writeFile("/etc/services", contents);
                EXPECT_NE(osutils({"services", "add", each.name, each.port}).status, 0);
                EXPECT_EQ(osutils({"services", "add", "--force", each.name, each.port}).status, 0);
                EXPECT_EQ(portOf(each.name), each.found);
              }
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

// ---- Free ports ----

// A socket that listens on the port. -1 if that fails.
int listenOn(int family, int port, bool on_loopback) {
  const int descriptor = socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int on = 1;
  setsockopt(descriptor, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
  sockaddr_in6 address6 = {};
  sockaddr_in address4 = {};
  int bound = 0;
  if (family == AF_INET6) {
    setsockopt(descriptor, IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof on);
    address6.sin6_family = AF_INET6;
    address6.sin6_port = htons(static_cast<uint16_t>(port));
    if (on_loopback) address6.sin6_addr = in6addr_loopback;
    bound = bind(descriptor, reinterpret_cast<sockaddr*>(&address6), sizeof address6);
  } else {
    address4.sin_family = AF_INET;
    address4.sin_port = htons(static_cast<uint16_t>(port));
    if (on_loopback) address4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bound = bind(descriptor, reinterpret_cast<sockaddr*>(&address4), sizeof address4);
  }
  return bound == 0 && listen(descriptor, 1) == 0 ? descriptor : -1;
}

void raiseLoopback() {
  const int descriptor = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ifreq request = {};
  strcpy(request.ifr_name, "lo");
  request.ifr_flags = IFF_UP;
  EXPECT_EQ(ioctl(descriptor, SIOCSIFFLAGS, &request), 0) << strerror(errno);
  close(descriptor);
}

TEST_F(Services, FreePortStopsAtTheLastPortOfTcp) {
  writeFile(file, "a 65534/tcp\nb 65535/udp\n");
  EXPECT_THAT(osutils(command("services", "free-port", file, {"65534"})).err,
              HasSubstr("unavailable (52): no free port from 65534 to 65535 in " + file));
  EXPECT_EQ(osutils(command("services", "free-port", file, {"65533"})).out, "PORT\n65533\n");
}

TEST_F(Services, FreePortPassesOverPortsThatAreInUse) {
  REQUIRE_ROOT("for a network of its own");
  EXPECT_EQ(
      withPrivateNetwork([&] {
        raiseLoopback();
        const auto first = [&](const std::string& start, const std::function<void()>& prepare) {
          return osutils(command("services", "free-port", file, {"--unused", start}), prepare);
        };
        const auto plain = [] {};
        EXPECT_EQ(first("4000", plain).out, "PORT\n4000\n");
        EXPECT_NE(listenOn(AF_INET, 4000, false), -1);
        EXPECT_NE(listenOn(AF_INET, 4001, true), -1);
        const bool has_ipv6 = listenOn(AF_INET6, 4002, false) != -1;
        if (has_ipv6) {
          EXPECT_NE(listenOn(AF_INET6, 4003, true), -1);
        }
        EXPECT_EQ(first("4000", plain).out, has_ipv6 ? "PORT\n4004\n" : "PORT\n4002\n");
        EXPECT_EQ(osutils(command("services", "free-port", file, {"4000"})).out, "PORT\n4000\n");
        EXPECT_EQ(first("4000", [] { failSystemCall(SYS_socket, 0, AF_INET6, EAFNOSUPPORT); }).out,
                  "PORT\n4002\n");
        EXPECT_EQ(first("4000", [] { failSystemCall(SYS_socket, 0, AF_INET, EAFNOSUPPORT); }).out,
                  has_ipv6 ? "PORT\n4000\n" : "");
        EXPECT_NE(listenOn(AF_INET, 65535, false), -1);
        EXPECT_EQ(first("65535", plain).status, 3);
        EXPECT_EQ(first("389", plain).out, "PORT\n390\n");
        return ::testing::Test::HasFailure() ? 1 : 0;
      }),
      0);
}

TEST_F(Services, FreePortTakesAPortWhoseConnectionsHaveEnded) {
  REQUIRE_ROOT("for a network of its own");
  EXPECT_EQ(withPrivateNetwork([&] {
              raiseLoopback();
              const int listening = listenOn(AF_INET, 4000, true);
              const int client = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
              sockaddr_in address = {};
              address.sin_family = AF_INET;
              address.sin_port = htons(4000);
              address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
              EXPECT_EQ(connect(client, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
              close(accept(listening, nullptr, nullptr));  // waits for late segments on this side
              close(client);
              close(listening);
              expectAnswer(osutils(command("services", "free-port", file, {"--unused", "4000"})),
                           "PORT\n4000\n");
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST_F(Services, FreePortSaysWhenNoPortCanBeTried) {
  REQUIRE_ROOT("for a network of its own");
  EXPECT_EQ(
      withPrivateNetwork([&] {
        const auto first = [&](const std::function<void()>& prepare) {
          return osutils(command("services", "free-port", file, {"--unused", "4000"}), prepare);
        };
        const auto fail = [](int family, unsigned error) {
          failSystemCall(SYS_socket, 0, static_cast<unsigned>(family), error);
        };
        const std::string error = "osutils: services free-port: ";
        for (const int family : {AF_INET, AF_INET6}) {
          expectFailure(
              first([&] { fail(family, EACCES); }),
              error + "operations error (1): cannot create a socket: Permission denied\n");
        }
        const auto no_tcp = error + "unavailable (52): this system has no TCP\n";
        expectFailure(first([&] {
                        fail(AF_INET, EAFNOSUPPORT);
                        fail(AF_INET6, EAFNOSUPPORT);
                      }),
                      no_tcp);
        const auto fail_bind = [](size_t size) {
          failSystemCall(SYS_bind, 2, static_cast<unsigned>(size), EADDRNOTAVAIL);
        };
        expectAnswer(first([&] { fail_bind(sizeof(sockaddr_in6)); }), "PORT\n4000\n");
        expectAnswer(first([&] { fail_bind(sizeof(sockaddr_in)); }), "PORT\n4000\n");
        expectFailure(first([&] {
                        fail_bind(sizeof(sockaddr_in));
                        fail_bind(sizeof(sockaddr_in6));
                      }),
                      no_tcp);
        return ::testing::Test::HasFailure() ? 1 : 0;
      }),
      0);
}

TEST_F(Services, FreePortPassesOverPortsThatTheCallerMayNotBind) {
  REQUIRE_OTHER_USERS();
  EXPECT_EQ(withPrivateNetwork([&] {
              return asUser(kNobody, [&] {
                const Result result =
                    osutils(command("services", "free-port", file, {"--unused", "1000"}),
                            dropCoverageCounters);
                EXPECT_EQ(result.out, "PORT\n1024\n");
                return ::testing::Test::HasFailure() ? 1 : 0;
              });
            }),
            0);
}

}  // namespace
