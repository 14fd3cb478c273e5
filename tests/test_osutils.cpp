// The command-line tool, run as a child process on scratch files.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;
using Arguments = std::vector<std::string>;

const char* const kServices =
    "# services of the test\n"
    "ssh\t22/tcp\t# remote shell\n"
    "domain  53/tcp\n"
    "domain  53/udp\n"
    "ldap    389/tcp  directory\n";

struct Result {
  int status = -1;  // 1000 and more when a signal ended the program
  std::string out;
  std::string err;
};

std::string readAll(int descriptor) {
  std::string text;
  char buffer[4096];
  for (ssize_t size; (size = read(descriptor, buffer, sizeof buffer)) > 0;) {
    text.append(buffer, static_cast<size_t>(size));
  }
  close(descriptor);
  return text;
}

// Runs a program. `prepare` is called in the child with its standard streams in place.
Result runProgram(
    Arguments arguments, const std::function<void()>& prepare = [] {}) {
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  int out[2];
  int err[2];
  if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) return {};

  const pid_t child = fork();
  if (child == 0) {
    dup2(out[1], STDOUT_FILENO);
    dup2(err[1], STDERR_FILENO);
    for (const char* name : {"TRC_DIR", "TRC_EVENTS", "TRC_MAX_BYTES", "PRINT_DEBUG"}) {
      unsetenv(name);
    }
    prepare();
    execv(argv[0], argv.data());
    _exit(126);
  }
  close(out[1]);
  close(err[1]);
  Result result;
  result.out = readAll(out[0]);
  result.err = readAll(err[0]);  // a line, so the pipe's buffer holds it meanwhile
  int status = 0;
  waitpid(child, &status, 0);
  result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
  return result;
}

Result osutils(
    Arguments arguments, const std::function<void()>& prepare = [] {}) {
  arguments.insert(arguments.begin(), OSUTILS_TOOL);
  return runProgram(std::move(arguments), prepare);
}

// For programs that may not write where the build keeps its coverage counters.
void dropCoverageCounters() {
  setenv("GCOV_PREFIX", "/dev/null", 1);
  setenv("GCOV_ERROR_FILE", "/dev/null", 1);
}

// Writes beyond this size fail from now on, as on a full disk.
void limitFileSize(rlim_t bytes) {
  const rlimit limit{bytes, bytes};
  setrlimit(RLIMIT_FSIZE, &limit);
  signal(SIGXFSZ, SIG_IGN);
  dropCoverageCounters();
}

void expectAnswer(const Result& result, const std::string& out) {
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.out, out);
  EXPECT_EQ(result.err, "");
}

void expectFailure(const Result& result, const ::testing::Matcher<std::string>& line) {
  EXPECT_EQ(result.status, 1);
  EXPECT_EQ(result.out, "");
  EXPECT_THAT(result.err, line);
  EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
}

class Tool : public ::testing::Test {
 protected:
  // Runs `osutils services COMMAND…` on the test's own file.
  Result services(
      Arguments arguments, const std::function<void()>& prepare = [] {}) const {
    arguments.insert(arguments.begin(), "services");
    arguments.insert(arguments.end(), {"--file", file});
    return osutils(std::move(arguments), prepare);
  }

  const TempDir temp;
  const std::string file = temp.file("services", kServices);
};

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
  expectAnswer(services({"add", "other", "400000", "--json"}), R"({"name":"other","port":400000})"
                                                               "\n");

  EXPECT_EQ(contentsOf(file), std::string(kServices) + "vraslapd\t3700/tcp\nother\t400000/tcp\n");
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
  expectAnswer(services({"port", name, "--json"}),
               R"({"name":")" + name + R"(","port":3700})" + "\n");
}

TEST_F(Tool, DeleteRemovesEveryLineOfTheServiceAndLeavesNoBackup) {
  expectAnswer(services({"delete", "domain"}), "DELETED\ndomain\n");
  EXPECT_EQ(contentsOf(file),
            "# services of the test\nssh\t22/tcp\t# remote shell\nldap    389/tcp  directory\n");

  expectAnswer(services({"delete", "ssh", "--json"}), R"({"deleted":"ssh"})"
                                                      "\n");
  EXPECT_EQ(contentsOf(file), "# services of the test\nldap    389/tcp  directory\n");
  EXPECT_FALSE(pathExists(file + ".vrasave"));
}

TEST_F(Tool, DeleteKeepsItsCopyAtTheBackupPath) {
  const std::string elsewhere = temp.dir("elsewhere");
  const std::string blocked = temp.dir("services.vrasave");  // the default path cannot be used

  expectFailure(services({"delete", "ldap"}),
                "osutils: services delete: insufficient access (50): "
                "cannot delete \"ldap\" from " +
                    file + "\n");
  expectAnswer(services({"delete", "ldap", "--backup", elsewhere + "/copy"}), "DELETED\nldap\n");

  EXPECT_FALSE(pathExists(elsewhere + "/copy"));
  EXPECT_TRUE(pathExists(blocked));
}

TEST_F(Tool, ShowsThePortOfAService) {
  expectAnswer(services({"port", "ldap"}), "NAME  PORT\nldap  389\n");
  expectAnswer(services({"port", "domain", "--json"}), R"({"name":"domain","port":53})"
                                                       "\n");
}

TEST_F(Tool, AcceptsTheNamesOfCommandsAsServices) {
  for (const std::string name : {"services", "list", "add", "delete", "port"}) {
    SCOPED_TRACE(name);
    expectAnswer(services({"add", name, "5000", "--json"}),
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
  expectAnswer(services({"free-port", "0", "--json"}), "{\"port\":1}\n");
  expectAnswer(services({"free-port", "400000"}), "PORT\n400000\n");
  writeFile(file, "a 3700/tcp\nb 3701/udp\n");
  expectAnswer(services({"free-port"}), "PORT\n3702\n");
}

TEST_F(Tool, WorksOnTheSystemsFileByDefault) {
  REQUIRE_ROOT("to put another file in the place of /etc/services");
  EXPECT_EQ(withPrivateEtc([] {
              writeFile("/etc/services", kServices);
              expectAnswer(osutils({"services", "add", "vraslapd", "3700"}),
                           "NAME      PORT\nvraslapd  3700\n");
              expectAnswer(osutils({"services", "port", "vraslapd", "--json"}),
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
      command.insert(command.end(), {"--file", each.path});
      expectFailure(osutils(command), line);
      command.push_back("--json");
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

TEST_F(Tool, AFailedQuestionNamesWhatFailedAndTheStateOfTheFile) {
  expectFailure(services({"port", "directory"}),
                "osutils: services port: " + file +
                    " has no service \"directory\"; checkFilePerms answers success (0) for " +
                    file + "\n");
  expectFailure(services({"free-port", "400001", "--json"}),
                "osutils: services free-port: no free port at or above 400001 in " + file +
                    "; checkFilePerms answers success (0) for " + file + "\n");
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
  expectFailure(services({"delete", "ssh", "--backup", file}),
                "osutils: services delete: insufficient access (50): cannot delete \"ssh\" from " +
                    file + "\n");
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, ReportsALineThatCouldNotBeAppended) {
  const std::string line =
      "osutils: services add: operations error (1): the new line of "
      "\"vraslapd\" is not complete in " +
      file + "\n";
  const size_t size = std::string(kServices).size();
  // nothing of it, a part of the name, of the port, and all but the newline
  for (const size_t room : {0U, 3U, 11U, 17U}) {
    SCOPED_TRACE(room);
    writeFile(file, kServices);
    expectFailure(services({"add", "vraslapd", "3700"}, [&] { limitFileSize(size + room); }), line);
    EXPECT_EQ(contentsOf(file).size(), size + room);
  }
}

TEST_F(Tool, ReportsADeletionThatCouldNotKeepACopy) {
  expectFailure(services({"delete", "ssh"}, [] { limitFileSize(70); }),
                "osutils: services delete: insufficient access (50): cannot delete \"ssh\" from " +
                    file + "; there is a copy at " + file + ".vrasave\n");
  EXPECT_EQ(contentsOf(file), kServices);
}

TEST_F(Tool, ReportsADeletionThatRemovedNoLine) {
  const std::string contents = std::string(95, 'a') + " 7/tcp\n";
  writeFile(file, contents);
  const std::string listed(90, 'a');
  expectFailure(services({"delete", listed}),
                "osutils: services delete: operations error (1): " + file +
                    " still has a service \"" + listed + "\"\n");
  EXPECT_EQ(contentsOf(file), contents);
}

TEST_F(Tool, ReportsRefusedPermissions) {
  REQUIRE_ROOT("to become another user");
  if (asUser(kNobody, [] { return access(OSUTILS_TOOL, X_OK) == 0 ? 0 : 1; }) != 0) {
    GTEST_SKIP() << "the build directory is closed to other users";
  }
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
      {{"add", "vraslapd", "3700", "--file", file},
       "add: insufficient access (50): cannot add \"vraslapd\" to " + file + "\n"},
      {{"delete", "ssh", "--file", file},
       "delete: insufficient access (50): cannot delete \"ssh\" from " + file + "\n"},
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
  expectFailure(services({"add", "vraslapd", "3700"}, closed),
                "osutils: services add: " + output + "Bad file descriptor\n");
  EXPECT_THAT(contentsOf(file), AllOf(StartsWith(kServices), EndsWith("#\nvraslapd\t3700/tcp\n")));
}

TEST_F(Tool, ReportsATraceThatCannotBeStarted) {
  for (const std::string& directory :
       {temp.path("services/below"), std::string("/dev/null"), std::string()}) {
    SCOPED_TRACE(directory);
    expectFailure(
        services({"add", "vraslapd", "3700", "--trace", directory}),
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
  expectAnswer(services({"free-port", "53", "--trace", trace}), "PORT\n54\n");
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
  expectAnswer(services({"add", "vraslapd", "3700", "--trace", trace}),
               "NAME      PORT\nvraslapd  3700\n");
  expectAnswer(services({"delete", "vraslapd", "--trace", deletion, "--json"}),
               "{\"deleted\":\"vraslapd\"}\n");

  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::addService",
                          "EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::getServicePort", "EtcServices::~EtcServices",
                          "EtcServices::~EtcServices"));
  EXPECT_THAT(outerCalls(callsIn(deletion)),
              ElementsAre("EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::deleteService",
                          "EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::~EtcServices", "EtcServices::~EtcServices"));
}

TEST_F(Trace, IsKeptWhenTheCommandFails) {
  expectFailure(services({"port", "vraslapd", "--trace", trace}),
                StartsWith("osutils: services port: " + file + " has no service"));
  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "checkFilePerms", "EtcServices::~EtcServices"));
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

}  // namespace
