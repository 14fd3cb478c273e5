// The commands of the families "process" and "module", and "platform".
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include "process_namespace.h"
#include "tool.h"
#include "tool_edits.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

// ---- Processes ----

class Processes : public Tool {
 protected:
  // Installs a launcher that runs this script.
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

// A child process that sleeps until it is ended, at the latest at the end of the scope.
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
  // Ends the child unless it has ended, and returns its status.
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
      "osutils: process start: operations error (1): " + launcher + " exited with status ";
  expectFailure(start({"a"}), failed + "127\n");  // not installed
  makeLauncher("exit 3");
  expectFailure(start({"a", "--json"}), failed + "3\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0644), 0);
  expectFailure(start({"a"}), failed + "126\n");
  expectFailure(
      osutils({"process", "start", "--launcher-dir", temp.path(), "a"},
              [] { withFault("no processes"); }),
      "osutils: process start: operations error (1): " + launcher + " could not be run\n");
  // The shell may exec the launcher and then ends with its status.
  makeLauncher("kill -9 $$");
  expectFailure(start({"a"}), ::testing::AnyOf(failed + "137\n",
                                               "osutils: process start: operations error (1): " +
                                                   launcher + " was killed by signal 9\n"));
}

TEST_F(Processes, StartRefusesWhatAShellWouldNotTakeAsItStands) {
  makeLauncher("touch " + written);
  const std::string refused = "osutils: process start: parameter error (89): ";
  for (const std::string argument : {"", "a b", "a\tb", "#", "#a"}) {
    SCOPED_TRACE(argument);
    std::string shown = argument;
    std::replace(shown.begin(), shown.end(), '\t', '?');
    expectFailure(start({"a", argument}),
                  refused + "the argument is not a plain shell word: \"" + shown + "\"\n");
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
    expectFailure(osutils({"process", "start", "--launcher-dir", directory, "a"}),
                  refused + "the directory is not a plain shell word: \"" + directory + "\"\n");
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

// The tool refuses these before it calls the library.
TEST_F(Processes, OnlyAPositiveNumberIsAProcess) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    for (const std::string pid :
         {"0", "-0", "-1", "abc", "1x", "", " 1", "+1", "0x1", "99999999999", "2147483648"}) {
      SCOPED_TRACE(pid);
      for (const std::string command : {"stop", "status"}) {
        Arguments arguments = {"process", command, "--", pid};
        if (command == "status") arguments.push_back("sleep");
        expectFailure(osutils(arguments),
                      "osutils: process " + command +
                          ": parameter error (89): PID is not a process id: \"" + pid + "\"\n");
      }
    }
  });
}

TEST_F(Processes, StatusAnswersYesAndNo) {
  if (runProgram({"/usr/bin/env", "ps", "-e"}).status != 0) GTEST_SKIP() << "needs ps";
  const Sleeper sleeper;
  // the child has its name after execl
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
                  "osutils: process status: parameter error (89): the program's name is not a "
                  "plain shell word: \"" +
                      program + "\"\n");
  }
}

// ---- Platform and modules ----

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

TEST_F(Tool, ModuleCheckReportsAFunctionThatNoLibraryHas) {
  expectFailure(
      osutils({"module", "check", INCOMPLETE_MODULE}),
      AllOf(StartsWith("osutils: module check: operations error (1): cannot load " INCOMPLETE_MODULE
                       ": "),
            HasSubstr("missingFunction")));
}

TEST_F(Tool, ModuleCheckReportsWhatIsNotALibrary) {
  const std::string failed = "osutils: module check: operations error (1): cannot load ";
  // The library's debug message takes the reason.
  EXPECT_THAT(osutils({"module", "check", "--verbose", temp.path("missing")}).err,
              ::testing::EndsWith("\n" + failed + temp.path("missing") + "\n"));
  for (const std::string& path : {temp.path("missing"), file, temp.path()}) {
    SCOPED_TRACE(path);
    expectFailure(osutils({"module", "check", path}), StartsWith(failed + path + ": "));
    expectFailure(osutils({"module", "check", "--json", path, "trcInit"}),
                  StartsWith(failed + path + ": "));
  }
  expectFailure(osutils({"module", "check", ""}),
                "osutils: module check: parameter error (89): FILE is empty\n");
}

}  // namespace
