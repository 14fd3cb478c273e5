#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

namespace {

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
  // The exit record does not have the result.
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
    const FailingCall format(Call::vra_asprintf, 0, 1000);  // counts only
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

// Returns a name that no other process has.
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

// Returns the line that the machine's ps prints for the process.
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

// Runs the body in a child process whose ps prints this if its arguments are the expected ones.
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

TEST(IsProcessStarted, SeesAProcessAfterAZombieWhoseIdEndsTheSame) {
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
    EXPECT_NE(complaint, "");  // from grep, because there is no pattern
  });
}

TEST(IsProcessStarted, OfAnEmptyListIsFalse) {
  withPs("", [] { EXPECT_FALSE(isProcessStarted("123", "vraslapd")); });
}

}  // namespace
