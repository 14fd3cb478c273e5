#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <unistd.h>

#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// ---- Launcher ----

// A directory with a launcher that logs its arguments, one a line, writes to both streams and then
// runs `end`.
class Launcher {
 public:
  explicit Launcher(const std::string& end = "exit 0") {
    program(dir_, "vrarun",
            "for word in \"$@\"; do echo \"$word\"; done > " + dir_.path("arguments") +
                "\necho to-out\necho to-err >&2\n" + end + "\n");
  }

  const char* dir() const { return dir_.path().c_str(); }
  bool wasRun() const { return pathExists(dir_.path("arguments")); }
  std::string arguments() const { return contentsOf(dir_.path("arguments")); }

 private:
  TempDir dir_;
};

TEST(StartProcess, RunsTheLauncherWithTheArgumentsAsWords) {
  const Launcher launcher;
  const Records records;

  EXPECT_EQ(startProcess(launcher.dir(), "a b"), 0);

  EXPECT_EQ(launcher.arguments(), "a\nb\n");
  EXPECT_THAT(records.trail(), ElementsAre("> startProcess", launchMessage(launcher.dir(), "a b"),
                                           "< startProcess 0"));
}

TEST(StartProcess, BuildsTheCommandForTheShell) {
  const FakeSystem system;

  EXPECT_EQ(startProcess("/opt/orx/ldap/V6.1/sbin/64", "inst1"), 0);

  EXPECT_THAT(system.commands(),
              ElementsAre("/opt/orx/ldap/V6.1/sbin/64/vrarun inst1 > /dev/null 2>&1"));
}

TEST(StartProcess, ThrowsTheOutputAway) {
  const Launcher launcher;
  int rc = -1;

  EXPECT_EQ(outputDuring([&] { rc = startProcess(launcher.dir(), "inst1"); }), "");

  EXPECT_EQ(rc, 0);
  EXPECT_TRUE(launcher.wasRun());
}

TEST(StartProcess, WithoutArgumentsRunsTheLauncherAlone) {
  const Launcher launcher;

  EXPECT_EQ(startProcess(launcher.dir(), ""), 0);

  EXPECT_EQ(launcher.arguments(), "");
}

TEST(StartProcess, AnswersTheRawStatusOfAFailure) {
  const Launcher launcher("exit 1");
  const Records records;

  EXPECT_EQ(startProcess(launcher.dir(), "inst1"), 256);

  EXPECT_THAT(records.trail(), ElementsAre("> startProcess", launchMessage(launcher.dir(), "inst1"),
                                           "<! startProcess 256"));
}

TEST(StartProcess, AnswersTheSignalInTheLowBits) {
  const Launcher launcher("kill -KILL $$");
  // So that the signal ends the launcher itself and not a shell around it.
  const std::string dir = std::string("exec ") + launcher.dir();

  EXPECT_EQ(startProcess(dir.c_str(), "inst1"), SIGKILL);

  EXPECT_TRUE(launcher.wasRun());
}

TEST(StartProcess, OfAMissingLauncherAnswersTheShellsStatus) {
  const TempDir empty;
  EXPECT_EQ(startProcess(empty.path().c_str(), "inst1"), 127 * 256);
}

TEST(StartProcess, WithoutAShellAnswersThatStatusToo) {
  REQUIRE_ROOT("to put something else in the shell's place");
  const Launcher launcher;
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("/dev/null", "/bin/sh", nullptr, MS_BIND, nullptr), 0);
              EXPECT_EQ(startProcess(launcher.dir(), "args"), 127 * 256);
              return 0;
            }),
            0);
  EXPECT_FALSE(launcher.wasRun());
}

TEST(StartProcess, DecodesNoStatusAndAsksForNoDistribution) {
  for (const int status : {0, 1, 9, 127, 256, 32512, 65280, -2}) {
    SCOPED_TRACE(status);
    const FakeSystem system(status);
    const Records records;

    EXPECT_EQ(startProcess("/dir", "args"), status);

    EXPECT_THAT(records.trail(),
                ElementsAre("> startProcess", launchMessage("/dir", "args"),
                            (status == 0 ? "< startProcess " : "<! startProcess ") +
                                std::to_string(status)));
  }
}

TEST(StartProcess, DoesNotScreenTheDirectory) {
  const Launcher launcher;
  const std::string dir = std::string("cd ") + launcher.dir() + "; .";
  const Records records;

  EXPECT_EQ(startProcess(dir.c_str(), "inst1"), 0);

  EXPECT_EQ(launcher.arguments(), "inst1\n");
  EXPECT_THAT(records.texts(), ElementsAre(launchMessage(dir, "inst1").substr(2)));
}

TEST(StartProcess, RefusesEachMetacharacterBeforeAnythingRuns) {
  for (const char character : kMetaCharacters) {
    SCOPED_TRACE(static_cast<int>(character));
    const std::string arguments = std::string("inst") + character + "rm";
    const FakeSystem system;
    const FailingCall format(Call::vra_asprintf, 0, 1000);  // counts only
    const Records records;

    EXPECT_EQ(startProcess("/dir", arguments.c_str()), 89);

    EXPECT_THAT(system.commands(), IsEmpty());
    EXPECT_EQ(format.calls(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> startProcess", "E startProcess: A metacharacter was passed in.\n",
                            "<! startProcess 89"));
  }
}

TEST(StartProcess, WithAMetacharacterLeavesARealLauncherAlone) {
  const Launcher launcher;

  EXPECT_EQ(startProcess(launcher.dir(), "inst;rm"), 89);

  EXPECT_FALSE(launcher.wasRun());
}

TEST(StartProcess, RefusesNullPointersBeforeAnythingElse) {
  const FakeSystem system;
  const Records records;

  EXPECT_EQ(startProcess(nullptr, "args"), 89);
  EXPECT_EQ(startProcess("/dir", nullptr), 89);
  EXPECT_EQ(startProcess(nullptr, "a;b"), 89);

  EXPECT_THAT(system.commands(), IsEmpty());
  const std::string message = "E startProcess: A NULL pointer was passed in.\n";
  EXPECT_THAT(records.trail(), ElementsAre("> startProcess", message, "<! startProcess 89",  //
                                           "> startProcess", message, "<! startProcess 89",  //
                                           "> startProcess", message, "<! startProcess 89"));
}

TEST(StartProcess, WithoutACommandRunsNothing) {
  const FakeSystem system;
  const FailingCall format(Call::vra_asprintf, ENOMEM);
  const Records records;

  EXPECT_EQ(startProcess("/dir", "args"), 90);

  EXPECT_TRUE(format.fired());
  EXPECT_THAT(system.commands(), IsEmpty());
  EXPECT_THAT(
      records.trail(),
      ElementsAre("> startProcess", "D startProcess vra_asprintf failed.\n", "<! startProcess 90"));
}

TEST(StartProcess, TakesAPrintThatAnswersAnotherNegativeNumber) {
  const FakeSystem system;
  const OddPrint print(-2);
  const LiveAllocations live;

  EXPECT_EQ(startProcess("/dir", "args"), 0);

  EXPECT_THAT(system.commands(), ElementsAre("/dir/vrarun args > /dev/null 2>&1"));
  EXPECT_EQ(live.blocks(), 0);
}

TEST(StartProcess, ReleasesTheCommand) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  for (const int status : {0, 256}) {
    const FakeSystem system(status);
    EXPECT_EQ(startProcess("/dir", "args"), status);
  }
  EXPECT_EQ(live.blocks(), 0);
}

// ---- Tracing ----

TEST(Processes, LeaveNoRecordsWhileTracingIsOff) {
  const FakeSystem system;
  const FakeKill kill;
  const Records records(0);

  EXPECT_EQ(startProcess("/dir", "args"), 0);
  EXPECT_EQ(startProcess("/dir", "a;b"), 89);
  EXPECT_EQ(stopProcess("12"), 0);
  EXPECT_EQ(stopProcess(nullptr), 89);
  EXPECT_TRUE(isProcessStarted("12", "a"));
  EXPECT_FALSE(isProcessStarted("12", nullptr));

  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

}  // namespace
