#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

namespace {

constexpr char kRedHat[] = "/etc/redhat-release";
constexpr char kSuSE[] = "/etc/SuSE-release";

const std::string kNoRedHat =
    "D isRedHat4_5() /etc/redhat-release doesn't exist, returning false\n";
const std::string kNoSuSE = "D isSuSE9() /etc/SuSE-release doesn't exist, returning false\n";
const std::string kEnteredRedHat = "D isRedHat4_5() entered...\n";
const std::string kEnteredSuSE = "D isSuSE9() entered...\n";

// Runs the body in a child process with a private /etc without release files.
void withoutReleaseFiles(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              std::filesystem::remove(kRedHat);
              std::filesystem::remove(kSuSE);
              body();
              return 0;
            }),
            0);
}

// Starts a process whose status is lost, and expects this result. Returns the messages of the
// distribution checks.
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
      {filler.substr(6) + "Nahant\n", true},  // ends with the last character of the buffer
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
      // Only ENOENT of the status query matters.
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
    // A directory can be opened for reading, but every read fails.
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
      // First lines of 254, 255 and 256 characters, and one of more than two buffers.
      {filler.substr(1) + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "x\nVERSION = 9\n", "VERSION = 9", true},
      {filler + filler + filler + "\nVERSION = 9\n", "VERSION = 9", true},
      {filler + "VERSION = 9\nSUSE\n", "SUSE", false},
      {filler + "VERSION = 9", "", false},
      // A second line that is cut off at the end of the buffer.
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

}  // namespace
