#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/sched.h>
#include <sched.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "process_namespace.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;

namespace {

constexpr std::string_view kMetaCharacters = "&;`'\"|*?~<>^()[]{}$\n\r\\";
static_assert(kMetaCharacters.size() == 22);

// Runs the body in a child process: the platform's answers are kept for the life of a process.
void inChildExpecting(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

// Makes a program of a shell script and returns its path.
std::string program(const TempDir& place, const std::string& name, const std::string& script) {
  const std::string path = place.file(name, "#!/bin/sh\n" + script);
  EXPECT_EQ(chmod(path.c_str(), 0755), 0) << path;
  return path;
}

// Has the commands that this process runs find the programs of the directory first.
void searchFirst(const TempDir& place) {
  const char* const usual = getenv("PATH");
  const std::string path = place.path() + ":" + (usual != nullptr ? usual : "/usr/bin:/bin");
  ASSERT_EQ(setenv("PATH", path.c_str(), 1), 0);
}

// What reaches the standard output and the standard error meanwhile.
std::string outputDuring(const std::function<void()>& body) {
  const TempDir temp;
  const std::string path = temp.file("output", "");
  fflush(nullptr);
  const int out = dup(STDOUT_FILENO);
  const int err = dup(STDERR_FILENO);
  const int file = open(path.c_str(), O_WRONLY | O_APPEND);
  EXPECT_TRUE(out != -1 && err != -1 && file != -1);
  dup2(file, STDOUT_FILENO);
  dup2(file, STDERR_FILENO);
  body();
  fflush(nullptr);
  dup2(out, STDOUT_FILENO);
  dup2(err, STDERR_FILENO);
  close(out);
  close(err);
  close(file);
  return contentsOf(path);
}

// ---- The launcher ----

// A directory with a launcher that writes down its arguments, one a line, talks on both streams and
// ends as told.
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

std::string launchMessage(const std::string& dir, const std::string& arguments) {
  return "D startProcess: command='" + dir + "/vrarun " + arguments + " > /dev/null 2>&1'.\n";
}

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
  // So that it is the launcher's own death and no shell stands between.
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
    const FailingCall format(Call::vra_asprintf, 0, 1000);  // only counts
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

// ---- Distributions, asked for when the status is lost ----

constexpr char kRedHat[] = "/etc/redhat-release";
constexpr char kSuSE[] = "/etc/SuSE-release";

const std::string kNoRedHat =
    "D isRedHat4_5() /etc/redhat-release doesn't exist, returning false\n";
const std::string kNoSuSE = "D isSuSE9() /etc/SuSE-release doesn't exist, returning false\n";
const std::string kEnteredRedHat = "D isRedHat4_5() entered...\n";
const std::string kEnteredSuSE = "D isSuSE9() entered...\n";

// Runs the body in a child process, in whose /etc there is no release file yet.
void withoutReleaseFiles(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              std::filesystem::remove(kRedHat);
              std::filesystem::remove(kSuSE);
              body();
              return 0;
            }),
            0);
}

// Starts a process whose status is lost, and checks that the answer is the expected one. Returns
// what the platform checks said.
std::vector<std::string> loseStatusExpecting(int answer) {
  const FakeSystem system(-1);
  const Records records;

  EXPECT_EQ(startProcess("/dir", "args"), answer);

  EXPECT_THAT(system.commands(), SizeIs(1));
  std::vector<std::string> trail = records.trail();
  if (trail.size() < 3) {
    ADD_FAILURE() << "only " << trail.size() << " records";
    return {};
  }
  EXPECT_EQ(trail[0], "> startProcess");
  EXPECT_EQ(trail[1], launchMessage("/dir", "args"));
  EXPECT_EQ(trail.back(), answer == 0 ? "< startProcess 0" : "<! startProcess -1");
  return std::vector(trail.begin() + 2, trail.end() - 1);
}

#define REQUIRE_RELEASE_FILES() REQUIRE_ROOT("for a private /etc with its own release files")

TEST(LostStatus, OnAnUnknownDistributionIsTheAnswer) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    EXPECT_THAT(loseStatusExpecting(-1),
                ElementsAre(kEnteredRedHat, kNoRedHat, kEnteredSuSE, kNoSuSE));
  });
}

TEST(LostStatus, OfAProcessThatCannotBeMadeIsTheSame) {
  inChildExpecting([] {
    const FailingCall system(Call::system, EAGAIN);
    const FailingCall no_files(Call::stat64, ENOENT, 1, 2);
    const Records records;

    EXPECT_EQ(startProcess("/dir", "args"), -1);

    EXPECT_TRUE(system.fired());
    EXPECT_EQ(no_files.calls(), 2);
    EXPECT_THAT(records.trail(),
                ElementsAre("> startProcess", launchMessage("/dir", "args"), kEnteredRedHat,
                            kNoRedHat, kEnteredSuSE, kNoSuSE, "<! startProcess -1"));
  });
}

TEST(LostStatus, OnTheRecognisedRedHatIsSuccessAndSuSEIsNotAskedFor) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kRedHat, "Red Hat Enterprise Linux AS release 4 (Nahant Update 4)\n");
    writeFile(kSuSE, "SUSE LINUX Enterprise Server 9\nVERSION = 9\n");

    EXPECT_THAT(loseStatusExpecting(0),
                ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning true\n"));
  });
}

TEST(LostStatus, OnTheRecognisedSuSEIsSuccess) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kSuSE, "SUSE LINUX Enterprise Server 9 (x86_64)\nVERSION = 9\n");

    EXPECT_THAT(loseStatusExpecting(0),
                ElementsAre(kEnteredRedHat, kNoRedHat, kEnteredSuSE,
                            "D /etc/SuSE-release: VERSION = 9\n", "D isSuSE9() returning true\n"));
  });
}

TEST(LostStatus, ReleasesTheCommandAndClosesTheReleaseFiles) {
  REQUIRE_RELEASE_FILES();
  REQUIRE_OWN_MALLOC();
  withoutReleaseFiles([] {
    writeFile(kRedHat, "Red Hat Enterprise Linux release 8\n");
    writeFile(kSuSE, "openSUSE\nVERSION = 8\n");
    const int open = openDescriptors();
    const LiveAllocations live;

    loseStatusExpecting(-1);

    EXPECT_EQ(live.blocks(), 0);
    EXPECT_EQ(openDescriptors(), open);
  });
}

TEST(LostStatus, AsksTheDistributionsWithoutRecordsWhileTracingIsOff) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kSuSE, "openSUSE\nVERSION = 11\n");
    const FakeSystem system(-1);
    const Records records(0);

    EXPECT_EQ(startProcess("/dir", "args"), 0);

    EXPECT_THAT(records.all(), IsEmpty());
    EXPECT_THAT(records.prints(), IsEmpty());
  });
}

struct Release {
  std::string contents;
  bool is_recognised;
};

TEST(RedHat, IsRecognisedByTheCodeNameOnTheFirstLine) {
  REQUIRE_RELEASE_FILES();
  const std::string filler(255, 'x');
  const Release releases[] = {
      {"Red Hat Enterprise Linux AS release 4 (Nahant)\n", true},
      {"Red Hat Enterprise Linux Server release 5 (Tikanga)\n", true},
      {"Tikanga", true},
      {"NahantTikanga\n", true},
      {"Red Hat Enterprise Linux Server release 6 (Santiago)\n", false},
      {"red hat (nahant)\n", false},
      {"Nahan\nt\n", false},
      {"\nNahant\n", false},
      {"release 3\nTikanga\n", false},
      {"", false},
      {"\n", false},
      {filler.substr(6) + "Nahant\n", true},  // its last character is the buffer's last
      {filler.substr(5) + "Nahant\n", false},
      {filler + "Tikanga\n", false},
  };
  withoutReleaseFiles([&] {
    for (const Release& release : releases) {
      SCOPED_TRACE(release.contents);
      writeFile(kRedHat, release.contents);
      inChildExpecting([&] {
        if (release.is_recognised) {
          EXPECT_THAT(loseStatusExpecting(0),
                      ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning true\n"));
        } else {
          EXPECT_THAT(loseStatusExpecting(-1),
                      ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning false\n", kEnteredSuSE,
                                  kNoSuSE));
        }
      });
    }
  });
}

TEST(RedHat, OnceRecognisedStaysSoWithoutItsFile) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kRedHat, "(Nahant)\n");
    loseStatusExpecting(0);
    std::filesystem::remove(kRedHat);

    EXPECT_THAT(
        loseStatusExpecting(0),
        ElementsAre(kEnteredRedHat, "D isRedHat4_5() checking already done, returning true\n"));
  });
}

TEST(Distributions, OnceMissedStaySoWithTheirFiles) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    loseStatusExpecting(-1);
    writeFile(kRedHat, "(Nahant)\n");
    writeFile(kSuSE, "SUSE\nVERSION = 9\n");

    EXPECT_THAT(
        loseStatusExpecting(-1),
        ElementsAre(kEnteredRedHat, "D isRedHat4_5() checking already done, returning false\n",
                    kEnteredSuSE, "D isSuSE9() checking already done, returning false\n"));
  });
}

TEST(Distributions, ThatAreOtherReleasesStaySo) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kRedHat, "(Santiago)\n");
    writeFile(kSuSE, "SUSE\nVERSION = 8\n");
    loseStatusExpecting(-1);
    writeFile(kRedHat, "(Nahant)\n");
    writeFile(kSuSE, "SUSE\nVERSION = 9\n");

    EXPECT_THAT(
        loseStatusExpecting(-1),
        ElementsAre(kEnteredRedHat, "D isRedHat4_5() checking already done, returning false\n",
                    kEnteredSuSE, "D isSuSE9() checking already done, returning false\n"));
  });
}

TEST(Distributions, WhoseFilesCannotBeOpenedAreMissedForGood) {
  inChildExpecting([] {
    {
      // What the status query says does not matter unless it is that there is no file.
      const FailingCall status(Call::stat64, EACCES, 1, 2);
      const FailingCall open(Call::fopen64, EACCES, 1, 2);

      EXPECT_THAT(
          loseStatusExpecting(-1),
          ElementsAre(kEnteredRedHat,
                      "D isRedHat4_5() couldn't open /etc/redhat-release, returning false\n",
                      kEnteredSuSE,
                      "D isSuSE9() couldn't open /etc/SuSE-release, returning false\n"));
      EXPECT_EQ(status.calls(), 2);
      EXPECT_EQ(open.calls(), 2);
    }
    const FailingCall status(Call::stat64, ENOENT);
    EXPECT_THAT(
        loseStatusExpecting(-1),
        ElementsAre(kEnteredRedHat, "D isRedHat4_5() checking already done, returning false\n",
                    kEnteredSuSE, "D isSuSE9() checking already done, returning false\n"));
    EXPECT_EQ(status.calls(), 0);
  });
}

TEST(Distributions, WhoseStatusQueryFailsOtherwiseAreReadAllTheSame) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kSuSE, "SUSE\nVERSION = 9\n");
    writeFile(kRedHat, "other\n");
    const FailingCall status(Call::stat64, EOVERFLOW, 1, 2);

    EXPECT_THAT(loseStatusExpecting(0),
                ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning false\n", kEnteredSuSE,
                            "D /etc/SuSE-release: VERSION = 9\n", "D isSuSE9() returning true\n"));
    EXPECT_EQ(status.calls(), 2);
  });
}

TEST(Distributions, WhoseFilesCannotBeReadAreMissed) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    // A directory can be opened for reading, and answers every read with an error.
    std::filesystem::create_directory(kRedHat);
    std::filesystem::create_directory(kSuSE);
    const int open = openDescriptors();

    EXPECT_THAT(loseStatusExpecting(-1),
                ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning false\n", kEnteredSuSE,
                            "D /etc/SuSE-release: \n", "D isSuSE9() returning false\n"));
    EXPECT_EQ(openDescriptors(), open);
  });
}

TEST(Distributions, TakeAReadErrorForAnEmptyLine) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kRedHat, "(Nahant)\n");
    writeFile(kSuSE, "VERSION = 9\nVERSION = 9\n");
    for (const int nth : {2, 3}) {  // the first or the second line of the second file
      SCOPED_TRACE(nth);
      inChildExpecting([&] {
        const FailingCall first(Call::fgets, EIO);
        const FailingCall second(Call::fgets, EIO, nth);

        EXPECT_THAT(loseStatusExpecting(-1),
                    ElementsAre(kEnteredRedHat, "D isRedHat4_5() returning false\n", kEnteredSuSE,
                                "D /etc/SuSE-release: \n", "D isSuSE9() returning false\n"));
        EXPECT_TRUE(first.fired());
        EXPECT_TRUE(second.fired());
      });
    }
  });
}

TEST(SuSE, IsRecognisedByTheVersionOnTheSecondLine) {
  REQUIRE_RELEASE_FILES();
  const std::string filler(255, 'x');
  struct Case {
    std::string contents;
    std::string second_line;
    bool is_recognised;
  };
  const Case cases[] = {
      {"SUSE\nVERSION = 9\n", "VERSION = 9", true},
      {"SUSE\nVERSION = 10\nPATCHLEVEL = 4\n", "VERSION = 10", true},
      {"SUSE\nVERSION = 11", "VERSION = 11", true},
      {std::string("SU\0SE\nVERSION = 10\n", 19), "VERSION = 10", true},
      {"SUSE\nVERSION = 12.1\n", "VERSION = 12.1", true},
      {"SUSE\nVERSION =  9\n", "VERSION =  9", true},
      {"SUSE\nOLD_VERSION = 9\n", "OLD_VERSION = 9", true},
      {"\nVERSION = 9\n", "VERSION = 9", true},
      {"SUSE\nVERSION = 8\n", "VERSION = 8", false},
      {"SUSE\nVERSION=9\n", "VERSION=9", false},
      {"SUSE\nVERSION =9\n", "VERSION =9", false},
      {"SUSE\nVERSION = \n", "VERSION = ", false},
      {"SUSE\nVERSION = nine\n", "VERSION = nine", false},
      {"SUSE\nVERSION = -9\n", "VERSION = -9", false},
      {"SUSE\nversion = 9\n", "version = 9", false},
      {"SUSE\nVERSION = 8 VERSION = 9\n", "VERSION = 8 VERSION = 9", false},
      {"SUSE\nPATCHLEVEL = 1\nVERSION = 9\n", "PATCHLEVEL = 1", false},
      {"VERSION = 9\nSUSE\n", "SUSE", false},
      {"VERSION = 9\n", "", false},
      {"VERSION = 9", "", false},
      {"VERSION = 9\n\n", "", false},
      {"", "", false},
      // A first line of 254, 255, 256 characters, and one that is longer than the buffer twice.
      {filler.substr(1) + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "x\nVERSION = 9\n", "VERSION = 9", true},
      {filler + filler + filler + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "VERSION = 9\nSUSE\n", "SUSE", false},
      {filler + "VERSION = 9", "", false},
      // A second line that loses what does not fit.
      {"SUSE\n" + filler.substr(12) + "VERSION = 10\n", filler.substr(12) + "VERSION = 10", true},
      {"SUSE\n" + filler.substr(11) + "VERSION = 10\n", filler.substr(11) + "VERSION = 1", false},
  };
  withoutReleaseFiles([&] {
    for (const Case& one : cases) {
      SCOPED_TRACE(one.contents);
      writeFile(kSuSE, one.contents);
      inChildExpecting([&] {
        EXPECT_THAT(loseStatusExpecting(one.is_recognised ? 0 : -1),
                    ElementsAre(kEnteredRedHat, kNoRedHat, kEnteredSuSE,
                                "D /etc/SuSE-release: " + one.second_line + "\n",
                                std::string("D isSuSE9() returning ") +
                                    (one.is_recognised ? "true\n" : "false\n")));
      });
    }
  });
}

TEST(SuSE, OnceRecognisedStaysSoWithoutItsFile) {
  REQUIRE_RELEASE_FILES();
  withoutReleaseFiles([] {
    writeFile(kSuSE, "SUSE\nVERSION = 10\n");
    loseStatusExpecting(0);
    std::filesystem::remove(kSuSE);

    EXPECT_THAT(
        loseStatusExpecting(0),
        ElementsAre(kEnteredRedHat, "D isRedHat4_5() checking already done, returning false\n",
                    kEnteredSuSE, "D isSuSE9() checking already done, returning true\n"));
  });
}

// ---- The thread library ----

// Runs the body in a child process where getconf is this script.
void withGetconf(const std::string& script, const std::function<void()>& body) {
  const TempDir programs;
  program(programs, "getconf", script);
  inChildExpecting([&] {
    searchFirst(programs);
    body();
  });
}

TEST(IsNPTL, IsWhatTheMachinesOwnGetconfSays) {
  FILE* const pipe = popen("getconf GNU_LIBPTHREAD_VERSION", "r");
  ASSERT_NE(pipe, nullptr);
  char line[100] = "";
  ASSERT_NE(fgets(line, sizeof line, pipe), nullptr);
  ASSERT_EQ(pclose(pipe), 0);

  inChildExpecting([&] {
    const Records records;
    EXPECT_EQ(isNPTL(), strncmp(line, "NPTL ", 5) == 0) << line;
    EXPECT_THAT(records.trail(), IsEmpty());
  });
}

TEST(IsNPTL, AsksGetconfForTheThreadLibrary) {
  withGetconf("[ \"$*\" = GNU_LIBPTHREAD_VERSION ] && echo NPTL 2.5\n",
              [] { EXPECT_TRUE(isNPTL()); });
}

TEST(IsNPTL, LooksForTheNameInTheFirst49CharactersOfTheFirstLine) {
  const std::string filler(45, 'x');
  const std::map<std::string, bool> answers = {
      {"NPTL 2.5", true},
      {"the NPTL", true},
      {"linuxthreads-0.10", false},
      {"nptl 2.5", false},
      {"", false},
      {"linuxthreads\\nNPTL 2.5", false},
      {filler + "NPTL", true},
      {filler + "xNPTL", false},
  };
  for (const auto& [output, answer] : answers) {
    SCOPED_TRACE(output);
    withGetconf("printf '" + output + "\\n'\n",
                [expected = answer] { EXPECT_EQ(isNPTL(), expected); });
  }
}

TEST(IsNPTL, OfAGetconfThatOnlyFailsIsFalse) {
  withGetconf("exit 1\n", [] {
    const Records records;
    EXPECT_FALSE(isNPTL());
    EXPECT_THAT(records.trail(), IsEmpty());
  });
}

TEST(IsNPTL, KeepsItsFirstAnswer) {
  const TempDir place;
  const std::string answer = place.file("answer", "NPTL 2.5\n");
  const std::string other = place.file("other", "linuxthreads-0.10\n");
  for (const bool first : {true, false}) {
    SCOPED_TRACE(first);
    withGetconf("cat " + place.path("now") + "\n", [&] {
      std::filesystem::copy_file(first ? answer : other, place.path("now"),
                                 std::filesystem::copy_options::overwrite_existing);
      EXPECT_EQ(isNPTL(), first);
      std::filesystem::copy_file(first ? other : answer, place.path("now"),
                                 std::filesystem::copy_options::overwrite_existing);
      EXPECT_EQ(isNPTL(), first);
    });
  }
}

TEST(IsNPTL, LeavesItsPipeOpenOnce) {
  inChildExpecting([] {
    const int before = openDescriptors();
    const FailingCall pipes(Call::popen, 0, 1000);  // only counts

    isNPTL();
    EXPECT_EQ(openDescriptors(), before + 1);
    isNPTL();

    EXPECT_EQ(openDescriptors(), before + 1);
    EXPECT_EQ(pipes.calls(), 1);
  });
}

TEST(IsNPTL, WithoutAPipeSaysSoAndIsFalseForGood) {
  withGetconf("echo NPTL 2.5\n", [] {
    const int before = openDescriptors();
    const Records records;
    {
      const FailingCall pipe(Call::popen, EMFILE);
      EXPECT_FALSE(isNPTL());
      EXPECT_TRUE(pipe.fired());
    }
    EXPECT_FALSE(isNPTL());

    EXPECT_THAT(records.trail(), ElementsAre("E popen faild: errno=24\n"));
    EXPECT_EQ(openDescriptors(), before);
  });
}

TEST(IsNPTL, WithoutAPipeSaysNothingWhileDebugIsOff) {
  inChildExpecting([] {
    const Records records(kAllEvents & ~kDebug);
    const FailingCall pipe(Call::popen, EMFILE);
    EXPECT_FALSE(isNPTL());
    EXPECT_THAT(records.all(), IsEmpty());
  });
}

TEST(IsNPTL, OfAPipeThatCannotBeReadIsFalseForGood) {
  inChildExpecting([] {  // with the machine's own getconf: nobody waits for it
    {
      const FailingCall read(Call::fgets, EIO);
      EXPECT_FALSE(isNPTL());
      EXPECT_TRUE(read.fired());
    }
    EXPECT_FALSE(isNPTL());
  });
}

// Interrupts the calls of this process that wait, every 10 ms.
void interruptOften() {
  struct sigaction handler = {};
  handler.sa_handler = [](int) {};  // without SA_RESTART
  ASSERT_EQ(sigaction(SIGALRM, &handler, nullptr), 0);
  constexpr itimerval kEvery{{0, 10'000}, {0, 10'000}};
  ASSERT_EQ(setitimer(ITIMER_REAL, &kEvery, nullptr), 0);
}

TEST(IsNPTL, ReadsOnWhereASignalInterruptedIt) {
  withGetconf("printf 'the NP'; sleep 0.2; echo 'TL 2.5'\n", [] {
    interruptOften();
    const int before = openDescriptors();
    const FailingCall pipes(Call::popen, 0, kNever);
    const FailingCall reads(Call::fgets, 0, kNever);

    EXPECT_TRUE(isNPTL());

    EXPECT_GT(reads.calls(), 1);
    EXPECT_EQ(pipes.calls(), 1);
    EXPECT_EQ(openDescriptors(), before + 1);
  });
}

TEST(IsNPTL, OfALineThatIsCutAfterASignalIsWhatThereIs) {
  for (const bool answer : {true, false}) {
    SCOPED_TRACE(answer);
    withGetconf(std::string("printf '") + (answer ? "NPTL" : "NPT") + "'; sleep 0.2\n", [answer] {
      interruptOften();
      EXPECT_EQ(isNPTL(), answer);
    });
  }
}

TEST(IsNPTL, IsTheSameForThreadsThatAskFirstAtTheSameTime) {
  withGetconf("echo NPTL 2.5\n", [] {
    constexpr int kThreads = 8;
    std::atomic<int> ready = 0;
    std::atomic<int> yes = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back([&] {
        ++ready;
        while (ready < kThreads) std::this_thread::yield();
        if (isNPTL()) ++yes;
      });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(yes, kThreads);
  });
}

// ---- Processes of the tests ----

// Another process, with this name (its first 15 characters) and, if wanted, this id. Until it is
// stopped it only waits; it never outlives the test.
class Other {
 public:
  explicit Other(const std::string& name, pid_t id = 0) {
    int ready[2];
    if (pipe(ready) == -1) {
      ADD_FAILURE() << "pipe: " << strerror(errno);
      return;
    }
    clone_args arguments = {};
    arguments.exit_signal = SIGCHLD;
    if (id != 0) {
      arguments.set_tid = reinterpret_cast<uintptr_t>(&id);
      arguments.set_tid_size = 1;
    }
    // System calls only from here on in the child: it was not made by fork().
    id_ = static_cast<pid_t>(syscall(SYS_clone3, &arguments, sizeof arguments));
    if (id_ == 0) {
      syscall(SYS_prctl, PR_SET_PDEATHSIG, SIGKILL, 0, 0, 0);
      syscall(SYS_prctl, PR_SET_NAME, name.c_str(), 0, 0, 0);
      syscall(SYS_close, ready[0]);
      syscall(SYS_close, ready[1]);
      for (;;) syscall(SYS_ppoll, nullptr, 0, nullptr, nullptr, 0);
    }
    EXPECT_NE(id_, -1) << "clone3: " << strerror(errno);
    close(ready[1]);
    char none;
    EXPECT_EQ(read(ready[0], &none, 1), 0);  // when the name is set
    close(ready[0]);
  }
  ~Other() {
    stop();
    collect();
  }
  Other(const Other&) = delete;
  Other& operator=(const Other&) = delete;

  pid_t id() const { return id_; }
  std::string text() const { return std::to_string(id_); }
  bool isAlive() const {
    siginfo_t info = {};
    return waitid(P_PID, static_cast<id_t>(id_), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == 0;
  }
  // Ends it and leaves a zombie.
  void stop() const {
    if (id_ <= 0) return;
    kill(id_, SIGKILL);
    siginfo_t info = {};
    EXPECT_EQ(waitid(P_PID, static_cast<id_t>(id_), &info, WEXITED | WNOWAIT), 0);
  }
  // Waits for its end; the wait status.
  int collect() {
    int status = -1;
    if (id_ > 0) waitpid(id_, &status, 0);
    id_ = -1;
    return status;
  }

 private:
  pid_t id_ = -1;
};

// ---- Stopping ----

// The tests below pass 0 and negative numbers: a signal that got out would end everything.
TEST(FakeKill, KeepsEveryonesSignals) {
  const FakeKill signals(7);

  EXPECT_EQ(kill(getpid(), 0), 7);
  std::thread([] { EXPECT_EQ(kill(getppid(), 0), 7); }).join();

  EXPECT_THAT(signals.signals(),
              ElementsAre(FakeKill::Signal{getpid(), 0}, FakeKill::Signal{getppid(), 0}));
}

TEST(StopProcess, KillsTheProcessAtOnceAndNoOther) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    Other victim("victim");
    const Other bystander("bystander");
    ASSERT_GT(victim.id(), 1);
    const Records records;

    EXPECT_EQ(stopProcess(victim.text().c_str()), 0);

    const int status = victim.collect();
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
    EXPECT_TRUE(bystander.isAlive());
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "< stopProcess 0"));
  });
}

TEST(StopProcess, OfAnUnknownProcessAnswersTheFailure) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other bystander("bystander");
    const Records records;

    errno = 0;
    EXPECT_EQ(stopProcess("30000"), -1);
    EXPECT_EQ(errno, ESRCH);

    EXPECT_TRUE(bystander.isAlive());
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "<! stopProcess -1"));
  });
}

TEST(StopProcess, OfAnothersProcessAnswersTheFailure) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other others("others");
    ASSERT_GT(others.id(), 1);
    EXPECT_EQ(asUser(kNobody,
                     [&] {
                       errno = 0;
                       EXPECT_EQ(stopProcess(others.text().c_str()), -1);
                       EXPECT_EQ(errno, EPERM);
                       return 0;
                     }),
              0);
    EXPECT_TRUE(others.isAlive());
  });
}

TEST(StopProcess, TakesTheNumberAtTheBeginningOfTheText) {
  const std::map<std::string, pid_t> numbers = {
      {"4711", 4711},   {" 12", 12},
      {"\t+12", 12},    {"12abc", 12},
      {"12 13", 12},    {"007", 7},
      {"0", 0},         {"", 0},
      {"abc", 0},       {"-1", -1},
      {"-4711", -4711}, {"1.5", 1},
      {"0x10", 0},      {"2147483647", 2147483647},
  };
  for (const auto& [text, number] : numbers) {
    SCOPED_TRACE(text);
    const FakeKill kill;
    const Records records;

    EXPECT_EQ(stopProcess(text.c_str()), 0);

    EXPECT_THAT(kill.signals(), ElementsAre(FakeKill::Signal{number, 9}));
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "< stopProcess 0"));
  }
}

TEST(StopProcess, DoesNotTryAgainAfterAFailure) {
  const FakeKill kill(-1);
  const Records records;

  EXPECT_EQ(stopProcess("abc"), -1);

  EXPECT_THAT(kill.signals(), ElementsAre(FakeKill::Signal{0, 9}));
  EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "<! stopProcess -1"));
}

TEST(StopProcess, RefusesEachMetacharacter) {
  for (const char character : kMetaCharacters) {
    SCOPED_TRACE(static_cast<int>(character));
    const std::string text = std::string("12") + character;
    const FakeKill kill;
    const Records records;

    EXPECT_EQ(stopProcess(text.c_str()), 89);

    EXPECT_THAT(kill.signals(), IsEmpty());
    EXPECT_THAT(records.trail(),
                ElementsAre("> stopProcess", "E stopProcess: A metacharacter was passed in.\n",
                            "<! stopProcess 89"));
  }
}

TEST(StopProcess, RefusesANullPointer) {
  const FakeKill kill;
  const Records records;

  EXPECT_EQ(stopProcess(nullptr), 89);

  EXPECT_THAT(kill.signals(), IsEmpty());
  EXPECT_THAT(records.trail(),
              ElementsAre("> stopProcess", "E stopProcess: A NULL pointer was passed in.\n",
                          "<! stopProcess 89"));
}

// ---- Finding ----

std::string probe(const std::string& pid, const std::string& name) {
  return "ps -e -o pid -o comm | grep " + pid + "[\\ ] | grep " + name +
         " | grep -v \\<defunct\\> > /dev/null 2>&1";
}

std::string probeMessage(const std::string& pid, const std::string& name) {
  return "D isProcessStarted: will run command='" + probe(pid, name) + "'.\n";
}

TEST(IsProcessStarted, RunsThisPipeline) {
  const FakeSystem system;
  const Records records;

  EXPECT_TRUE(isProcessStarted("123", "vraslapd"));

  EXPECT_THAT(system.commands(),
              ElementsAre("ps -e -o pid -o comm | grep 123[\\ ] | grep vraslapd | "
                          "grep -v \\<defunct\\> > /dev/null 2>&1"));
  // The answer is not recorded as a code.
  EXPECT_THAT(records.trail(),
              ElementsAre("> isProcessStarted",
                          "D isProcessStarted: will run command='ps -e -o pid -o comm | "
                          "grep 123[\\ ] | grep vraslapd | grep -v \\<defunct\\> "
                          "> /dev/null 2>&1'.\n",
                          "< isProcessStarted 0"));
}

TEST(IsProcessStarted, IsTrueForTheStatusZeroOnly) {
  for (const int status : {-1, 1, 9, 256, 512, 32512}) {
    SCOPED_TRACE(status);
    const FakeSystem system(status);
    const Records records;

    EXPECT_FALSE(isProcessStarted("123", "vraslapd"));

    EXPECT_THAT(records.trail(), ElementsAre("> isProcessStarted", probeMessage("123", "vraslapd"),
                                             "< isProcessStarted 0"));
  }
}

TEST(IsProcessStarted, WithoutAShellIsFalse) {
  const FailingCall system(Call::system, EAGAIN);
  EXPECT_FALSE(isProcessStarted("1", "a"));
  EXPECT_TRUE(system.fired());
}

TEST(IsProcessStarted, WithoutACommandRunsNothing) {
  const FakeSystem system;
  const FailingCall format(Call::vra_asprintf, ENOMEM);
  const Records records;

  EXPECT_FALSE(isProcessStarted("123", "vraslapd"));

  EXPECT_TRUE(format.fired());
  EXPECT_THAT(system.commands(), IsEmpty());
  EXPECT_THAT(records.trail(),
              ElementsAre("> isProcessStarted", "D isProcessStarted: vra_asprintf failed.\n",
                          "< isProcessStarted 0"));
}

TEST(IsProcessStarted, TakesAPrintThatAnswersAnotherNegativeNumber) {
  const FakeSystem system;
  const OddPrint print(-2);
  const LiveAllocations live;

  EXPECT_TRUE(isProcessStarted("123", "vraslapd"));

  EXPECT_THAT(system.commands(), ElementsAre(probe("123", "vraslapd")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST(IsProcessStarted, RefusesNullPointersWithTheNameOfTheStopOperation) {
  const FakeSystem system;
  const Records records;

  EXPECT_FALSE(isProcessStarted(nullptr, "vraslapd"));
  EXPECT_FALSE(isProcessStarted("123", nullptr));
  EXPECT_FALSE(isProcessStarted("1;2", nullptr));

  EXPECT_THAT(system.commands(), IsEmpty());
  const std::string message = "D stopProcess: A NULL pointer was passed in.\n";
  EXPECT_THAT(records.trail(),
              ElementsAre("> isProcessStarted", message, "< isProcessStarted 0",  //
                          "> isProcessStarted", message, "< isProcessStarted 0",  //
                          "> isProcessStarted", message, "< isProcessStarted 0"));
}

TEST(IsProcessStarted, RefusesEachMetacharacterInBothArgumentsBeforeAnythingRuns) {
  for (const char character : kMetaCharacters) {
    SCOPED_TRACE(static_cast<int>(character));
    const std::string bad = std::string("1") + character;
    const FakeSystem system;
    const FailingCall format(Call::vra_asprintf, 0, 1000);  // only counts
    const Records records;

    EXPECT_FALSE(isProcessStarted(bad.c_str(), "vraslapd"));
    EXPECT_FALSE(isProcessStarted("1", bad.c_str()));

    EXPECT_THAT(system.commands(), IsEmpty());
    EXPECT_EQ(format.calls(), 0);
    const std::string message = "D stopProcess: A meta character was passed in.\n";
    EXPECT_THAT(records.trail(),
                ElementsAre("> isProcessStarted", message, "< isProcessStarted 0",
                            "> isProcessStarted", message, "< isProcessStarted 0"));
  }
}

TEST(IsProcessStarted, ReleasesTheCommand) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  for (const int status : {0, 256, -1}) {
    const FakeSystem system(status);
    EXPECT_EQ(isProcessStarted("123", "vraslapd"), status == 0);
  }
  EXPECT_EQ(live.blocks(), 0);
}

// A name that no other process has.
std::string ownName() { return "osu-" + std::to_string(getpid()); }

TEST(IsProcessStarted, FindsALiveProcessByItsIdAndName) {
  const std::string name = ownName();
  const Other live(name);

  EXPECT_TRUE(isProcessStarted(live.text().c_str(), name.c_str()));
  EXPECT_TRUE(isProcessStarted(live.text().c_str(), name.substr(1, 4).c_str()));
  EXPECT_FALSE(isProcessStarted(live.text().c_str(), (name + "x").c_str()));
}

// The kernel keeps the first 15 characters of a name.
TEST(IsProcessStarted, OfANameOfMoreThan15CharactersIsFalse) {
  const std::string kept = (ownName() + "---------------").substr(0, 15);
  const Other live(kept + "x");

  EXPECT_FALSE(isProcessStarted(live.text().c_str(), (kept + "x").c_str()));
  EXPECT_TRUE(isProcessStarted(live.text().c_str(), kept.c_str()));
}

TEST(IsProcessStarted, OfAProcessThatHasEndedIsFalse) {
  const std::string name = ownName();
  Other ended(name);
  const std::string id = ended.text();
  ended.stop();
  ended.collect();

  EXPECT_FALSE(isProcessStarted(id.c_str(), name.c_str()));
}

TEST(IsProcessStarted, PrintsNothing) {
  const std::string name = ownName();
  const Other live(name);
  bool answer = false;

  EXPECT_EQ(outputDuring([&] { answer = isProcessStarted(live.text().c_str(), name.c_str()); }),
            "");

  EXPECT_TRUE(answer);
}

TEST(IsProcessStarted, LeavesNoProcessAndNoDescriptorBehind) {
  inChildExpecting([] {
    const int open = openDescriptors();
    (void)isProcessStarted("1", "a");
    EXPECT_EQ(openDescriptors(), open);
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), -1);
    EXPECT_EQ(errno, ECHILD);
  });
}

TEST(IsProcessStarted, TakesAnIdThatEndsWithTheTextForIt) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other server("vraslapd", 4123);
    ASSERT_EQ(server.id(), 4123);

    EXPECT_TRUE(isProcessStarted("4123", "vraslapd"));
    EXPECT_TRUE(isProcessStarted("123", "vraslapd"));
    EXPECT_TRUE(isProcessStarted("3", "vraslapd"));
    EXPECT_FALSE(isProcessStarted("412", "vraslapd"));
    EXPECT_FALSE(isProcessStarted("124", "vraslapd"));
    EXPECT_FALSE(isProcessStarted("14123", "vraslapd"));
  });
}

TEST(IsProcessStarted, OfAnIdThatRunsAnotherProgramIsFalse) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other server("vraslapd", 200);
    const Other other("other", 300);

    EXPECT_FALSE(isProcessStarted("300", "vraslapd"));
    EXPECT_FALSE(isProcessStarted("200", "other"));
    EXPECT_TRUE(isProcessStarted("300", "other"));
  });
}

// The line that the machine's own ps prints for the process.
std::string lineOfPs(const std::string& id) {
  FILE* const pipe = popen(("ps -o comm= -p " + id).c_str(), "r");
  if (pipe == nullptr) return "";
  char line[200] = "";
  EXPECT_NE(fgets(line, sizeof line, pipe), nullptr);
  pclose(pipe);
  return line;
}

TEST(IsProcessStarted, OfAZombieIsFalseUnlessTheMachinesPsHidesThatItIsOne) {
  const std::string name = ownName();
  const Other zombie(name);
  const std::string id = zombie.text();
  zombie.stop();
  ASSERT_THAT(contentsOf("/proc/" + id + "/stat"), HasSubstr(") Z "));
  const std::string line = lineOfPs(id);
  ASSERT_THAT(line, HasSubstr(name));

  EXPECT_EQ(isProcessStarted(id.c_str(), name.c_str()), line.find("<defunct>") == line.npos);
}

// Runs the body in a child process where ps prints this, when it is asked for what it must be.
void withPs(const std::string& output, const std::function<void()>& body) {
  const TempDir programs;
  const std::string text = programs.file("output", output);
  program(programs, "ps", "[ \"$*\" = '-e -o pid -o comm' ] && cat " + text + "\n");
  inChildExpecting([&] {
    searchFirst(programs);
    body();
  });
}

TEST(IsProcessStarted, DropsTheLinesThatPsMarksAsZombies) {
  withPs(
      "    PID COMMAND\n"
      "    123 vraslapd <defunct>\n"
      "    456 vraslapd\n",
      [] {
        EXPECT_FALSE(isProcessStarted("123", "vraslapd"));
        EXPECT_TRUE(isProcessStarted("456", "vraslapd"));
      });
}

TEST(IsProcessStarted, SeesAProcessBehindAZombieWhoseIdEndsTheSame) {
  withPs("    123 vraslapd <defunct>\n   4123 vraslapd\n",
         [] { EXPECT_TRUE(isProcessStarted("123", "vraslapd")); });
}

TEST(IsProcessStarted, OfAZombieThatPsDoesNotMarkIsTrue) {
  withPs("    123 vraslapd\n", [] { EXPECT_TRUE(isProcessStarted("123", "vraslapd")); });
}

TEST(IsProcessStarted, KeepsALineThatOnlySaysDefunct) {
  withPs("    123 defunct\n", [] { EXPECT_TRUE(isProcessStarted("123", "defunct")); });
}

TEST(IsProcessStarted, LooksForTheNameAnywhereInTheLine) {
  withPs("    123 my-vraslapd-2\n  77 a vraslapd b\n    88 Vraslapd\n", [] {
    EXPECT_TRUE(isProcessStarted("123", "vraslapd"));
    EXPECT_TRUE(isProcessStarted("77", "vraslapd"));
    EXPECT_FALSE(isProcessStarted("88", "vraslapd"));
    EXPECT_TRUE(isProcessStarted("123", "23"));
  });
}

TEST(IsProcessStarted, TakesBothTextsForPatterns) {
  withPs("    123 vraslapd\n", [] {
    EXPECT_TRUE(isProcessStarted("1.3", "v.a"));
    EXPECT_FALSE(isProcessStarted("1.4", "v.a"));
  });
}

TEST(IsProcessStarted, WithEmptyTextsMatchesEveryIdAndNoName) {
  withPs("    123 vraslapd\n", [] {
    EXPECT_TRUE(isProcessStarted("", "vraslapd"));
    bool answer = true;
    const std::string complaint = outputDuring([&] { answer = isProcessStarted("123", ""); });
    EXPECT_FALSE(answer);
    EXPECT_NE(complaint, "");  // of a grep without a pattern
  });
}

TEST(IsProcessStarted, OfAnEmptyListIsFalse) {
  withPs("", [] { EXPECT_FALSE(isProcessStarted("123", "vraslapd")); });
}

// ---- What the screening is for ----

// One program that a shell was made to run: its name and its arguments.
using Words = std::vector<std::string>;

constexpr std::string_view kBlanks = " \t";

// How a shell takes a text without metacharacters: words between blanks and tabs, up to one that
// begins with "#", which makes a comment of the rest of the line.
struct Literal {
  Words words;
  bool ends_the_line = false;
};
Literal literal(std::string_view text) {
  Literal result;
  while (true) {
    const size_t begin = text.find_first_not_of(kBlanks);
    if (begin == text.npos) return result;
    text.remove_prefix(begin);
    if (text.front() == '#') {
      result.ends_the_line = true;
      return result;
    }
    const size_t length = std::min(text.find_first_of(kBlanks), text.size());
    result.words.emplace_back(text.substr(0, length));
    text.remove_prefix(length);
  }
}

// Texts of up to 12 pieces: mostly such as mean something to some shell somewhere in a line.
class RandomTexts {
 public:
  std::string next() {
    static constexpr std::string_view kPieces[] = {" ",        "  ",
                                                   "\t",       "#",
                                                   "!",        "%",
                                                   "+",        ",",
                                                   "-",        ".",
                                                   "/",        ":",
                                                   "=",        "@",
                                                   "_",        "a",
                                                   "Z",        "0",
                                                   "1",        "2",
                                                   "if",       "then",
                                                   "fi",       "do",
                                                   "done",     "while",
                                                   "case",     "esac",
                                                   "exec",     "eval",
                                                   "!!",       "!1",
                                                   "..",       "./",
                                                   "/etc",     "//",
                                                   "--",       "-r",
                                                   "-f",       "%1",
                                                   "A=b",      "PATH=",
                                                   "+=",       "x=1 y",
                                                   "inst1",    "vraslapd",
                                                   "\x01",     "\x02",
                                                   "\x07",     "\x08",
                                                   "\x0b",     "\x0c",
                                                   "\x1b",     "\x1f",
                                                   "\x7f",     "\x80",
                                                   "\x81",     "\x82",
                                                   "\x88",     "\xa0",
                                                   "\xc2\xa0", "\xe2\x80\x83",
                                                   "\xff"};
    std::string text;
    for (size_t pieces = below(13); pieces > 0; --pieces) {
      switch (below(20)) {
        case 0:
          text += static_cast<char>(1 + below(255));
          break;
        case 1:
          if (below(4) == 0) text += kMetaCharacters[below(kMetaCharacters.size())];
          break;
        default:
          text += kPieces[below(std::size(kPieces))];
      }
    }
    return text;
  }

 private:
  size_t below(size_t bound) { return random_() % bound; }

  std::mt19937 random_{20061116};
};

bool isClean(std::string text) { return !checkForMetaChars(text.data()); }

// What a real shell does with the commands: the programs of each, in no particular order, and how
// many commands of any kind it came to run for it. The shell knows `programs` as functions that
// write down how they are called, and finds no other program.
struct ShellRun {
  std::vector<Words> programs;
  int commands = 0;
};
std::vector<ShellRun> runInShell(const std::vector<std::string>& commands,
                                 const std::vector<std::string>& programs) {
  const TempDir temp;
  const std::string empty = temp.dir("empty");
  const std::string log = temp.file("log", "");
  const std::string mark = "-one-command-";

  // Traces go to the standard error: one mark for every command. Those of the functions' own
  // commands are thrown away. A function's one write is short enough to stay whole.
  std::string script = "PATH=" + empty + "\nPS4='" + mark + "'\ncd " + empty + "\n";
  for (const std::string& name : programs) {
    script += name + "() { printf '%s\\0' \"$osu_case\" \"$#\" " + name + " \"$@\" >> " + log +
              "; } 2> /dev/null\n";
  }
  script += "set -x\n";
  for (size_t i = 0; i < commands.size(); ++i) {
    script += "osu_case=" + std::to_string(i) + "\n" + commands[i] + "\n";
  }
  script += "osu_case=end\n";
  const std::string file = temp.file("script", script);
  const std::string trace = temp.path("trace");
  EXPECT_EQ(system(("/bin/sh " + file + " 2> " + trace + " < /dev/null").c_str()) % 256, 0);

  std::vector<ShellRun> runs(commands.size());
  const std::string traced = contentsOf(trace);
  size_t current = 0;
  bool ended = false;
  for (size_t at = traced.find(mark); at != traced.npos; at = traced.find(mark, at)) {
    at += mark.size();
    constexpr std::string_view kCase = "osu_case=";
    if (traced.compare(at, kCase.size(), kCase) != 0) {
      if (current < runs.size()) ++runs[current].commands;
      continue;
    }
    const std::string number = traced.substr(at + kCase.size(), traced.find('\n', at) - at - 9);
    ended = number == "end";
    if (!ended) current = std::stoul(number);
  }
  EXPECT_TRUE(ended) << "the shell gave up after command " << current << ": " << commands[current];

  const std::string logged = contentsOf(log);
  size_t at = 0;
  const auto field = [&] {
    const size_t end = std::min(logged.find('\0', at), logged.size());
    const std::string text = logged.substr(at, end - at);
    at = end + 1;
    return text;
  };
  while (at < logged.size()) {
    const size_t index = std::stoul(field());
    const size_t arguments = std::stoul(field());
    Words words = {field()};
    for (size_t i = 0; i < arguments; ++i) words.push_back(field());
    runs.at(index).programs.push_back(words);
  }
  for (ShellRun& run : runs) std::sort(run.programs.begin(), run.programs.end());
  return runs;
}

std::string printable(const std::string& text) { return testing::PrintToString(text); }

TEST(Screening, LeavesOnlyWordsForTheLauncher) {
  constexpr size_t kTexts = 6000;
  RandomTexts texts;
  std::vector<std::string> accepted;
  const FakeSystem system;
  size_t refused = 0;
  while (accepted.size() < kTexts) {
    const std::string text = texts.next();
    // The directory is not screened, so it can put a program of ours before the launcher's name.
    const int rc = startProcess("launch ", text.c_str());
    ASSERT_EQ(rc, isClean(text) ? 0 : 89) << printable(text);
    if (rc == 0) {
      accepted.push_back(text);
    } else {
      ++refused;
    }
  }
  EXPECT_GT(refused, kTexts / 50);
  std::vector<std::string> commands;
  for (const auto& command : system.commands()) commands.push_back(command.value());
  ASSERT_EQ(commands.size(), kTexts);

  const std::vector<ShellRun> runs = runInShell(commands, {"launch"});

  for (size_t i = 0; i < kTexts; ++i) {
    Words words = {"launch", "/vrarun"};
    for (const std::string& word : literal(accepted[i]).words) words.push_back(word);
    ASSERT_THAT(runs[i].programs, ElementsAre(words)) << printable(accepted[i]);
    ASSERT_EQ(runs[i].commands, 1) << printable(accepted[i]);
  }
}

// The programs that the pipeline of isProcessStarted runs with these texts.
std::vector<Words> pipelineOf(const std::string& pid, const std::string& name) {
  std::vector<Words> programs = {{"ps", "-e", "-o", "pid", "-o", "comm"}};
  const auto add = [&](Words first, const Literal& rest) {
    first.insert(first.end(), rest.words.begin(), rest.words.end());
    programs.push_back(first);
    return !rest.ends_the_line;
  };
  // The bracket expression belongs to the last word of the id, or is a word of its own.
  Literal id = literal(pid + "[]");
  if (!id.ends_the_line) id.words.back().insert(id.words.back().size() - 1, " ");
  if (add({"grep"}, id) && add({"grep"}, literal(name))) {
    programs.push_back({"grep", "-v", "<defunct>"});
  }
  std::sort(programs.begin(), programs.end());
  return programs;
}

TEST(Screening, LeavesOnlyWordsForPsAndGrep) {
  constexpr size_t kPairs = 1500;
  RandomTexts texts;
  std::vector<std::pair<std::string, std::string>> accepted;
  const FakeSystem system;
  size_t refused = 0;
  while (accepted.size() < kPairs) {
    const std::string pid = texts.next();
    const std::string name = texts.next();
    const bool answer = isProcessStarted(pid.c_str(), name.c_str());
    ASSERT_EQ(answer, isClean(pid) && isClean(name)) << printable(pid) << printable(name);
    if (answer) {
      accepted.emplace_back(pid, name);
    } else {
      ++refused;
    }
  }
  EXPECT_GT(refused, kPairs / 50);
  std::vector<std::string> commands;
  for (const auto& command : system.commands()) commands.push_back(command.value());
  ASSERT_EQ(commands.size(), kPairs);

  const std::vector<ShellRun> runs = runInShell(commands, {"ps", "grep"});

  for (size_t i = 0; i < kPairs; ++i) {
    const auto& [pid, name] = accepted[i];
    const std::vector<Words> expected = pipelineOf(pid, name);
    ASSERT_THAT(runs[i].programs, ElementsAreArray(expected)) << printable(pid) << printable(name);
    ASSERT_EQ(runs[i].commands, static_cast<int>(expected.size()))
        << printable(pid) << printable(name);
  }
}

// That the two cases above can fail: a shell that is given the metacharacters does something else.
TEST(Screening, IsWhatKeepsTheShellFromObeying) {
  const std::vector<ShellRun> runs =
      runInShell({"launch /vrarun a;other b > /dev/null 2>&1", "launch /vrarun a > /dev/null 2>&1",
                  "launch /vrarun A=$((1+1)) > /dev/null 2>&1"},
                 {"launch"});

  EXPECT_EQ(runs[0].commands, 2);  // one of them without a program
  EXPECT_THAT(runs[0].programs, ElementsAre(Words{"launch", "/vrarun", "a"}));
  EXPECT_EQ(runs[1].commands, 1);
  EXPECT_THAT(runs[2].programs, ElementsAre(Words{"launch", "/vrarun", "A=2"}));
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
