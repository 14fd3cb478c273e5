#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "test_directoryutils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

namespace {

// ---- Expected records ----

Trail forced(const std::string& path) {
  return debug("deleteDirForcefully: command = 'rm -rf " + path + "'.\n");
}
Trail forcedInVain(int status) {
  return debug("deleteDirForcefully: Failed to delete dir with rc='" + std::to_string(status) +
               "'");
}

// ---- Fixture ----

// Discards what the commands of this process write to standard error.
void silence() {
  const int nowhere = open("/dev/null", O_WRONLY | O_CLOEXEC);
  ASSERT_NE(nowhere, -1);
  ASSERT_EQ(dup2(nowhere, STDERR_FILENO), STDERR_FILENO);
  close(nowhere);
}

void makeDirectory(const std::string& path) { ASSERT_EQ(mkdir(path.c_str(), 0755), 0) << path; }

TRACED_AND_NOT(DeleteDirForcefully);

// ---- The command ----

TEST_P(DeleteDirForcefully, RefusesANullPath) {
  const FakeSystem shell;
  EXPECT_FALSE(deleteDirForcefully(nullptr));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0,
                                 debug("deleteDirForcefully: passed a null pointer.\n"))));
  EXPECT_THAT(shell.commands(), IsEmpty());
}

TEST_P(DeleteDirForcefully, RunsOneCommandThatItLogsBefore) {
  std::string path = temp_.dir("directory");
  const FakeSystem shell;
  Trail before;
  const BeforeCall run(Call::system, [&] { before = records_.trail(); });

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(run.fired());
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(before, traced(Trail{"> deleteDirForcefully"}, isThere(), forced(path)));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_TRUE(pathExists(path)) << "nothing but the command removes it";
}

TEST_P(DeleteDirForcefully, ShowsTheStatusAsItComes) {
  std::string path = temp_.dir("directory");
  for (const int status : {1, 9, 256, 32512, 65280, -1}) {
    SCOPED_TRACE(status);
    const FakeSystem shell(status);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), forced(path),
                                   forcedInVain(status))));
  }
}

TEST_P(DeleteDirForcefully, FailsWhenNoShellCanBeStarted) {
  std::string path = temp_.dir("directory");
  const FailingCall shell(Call::system, EAGAIN);

  EXPECT_FALSE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(shell.fired());
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(-1))));
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, FreesTheCommandWhateverItsStatus) {
  REQUIRE_OWN_MALLOC();
  std::string path = temp_.dir("directory");
  for (const int status : {0, 256}) {
    const FakeSystem shell(status);
    const LiveAllocations live;
    EXPECT_EQ(deleteDirForcefully(path.data()), status == 0);
    EXPECT_EQ(live.blocks(), 0);
  }
}

TEST_P(DeleteDirForcefully, RefusesEachMetacharacterBeforeAnythingRuns) {
  constexpr char kRefused[] = "&;`'\"|*?~<>^()[]{}$\n\r\\";
  static_assert(sizeof kRefused - 1 == 22);
  const FakeSystem shell;
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Trail refused =
      call("deleteDirForcefully", 0, debug("deleteDirForcefully: passed in a metacharacter.\n"));

  for (const char character : std::string(kRefused)) {
    const std::string one(1, character);
    for (const std::string& name : {one, one + "end", "start" + one, "be" + one + "tween"}) {
      SCOPED_TRACE(name);
      std::string path = temp_.dir(name);
      EXPECT_FALSE(deleteDirForcefully(path.data()));
      EXPECT_EQ(trail(), traced(refused));
      EXPECT_TRUE(std::filesystem::is_directory(path));

      std::string below = temp_.dir(name + "/plain");
      EXPECT_FALSE(deleteDirForcefully(below.data()));
      EXPECT_EQ(trail(), traced(refused));
      EXPECT_TRUE(std::filesystem::is_directory(below));

      std::string absent = temp_.path("absent" + one);
      EXPECT_FALSE(deleteDirForcefully(absent.data()));
      EXPECT_EQ(trail(), traced(refused));
    }
  }

  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_EQ(print.calls(), 0);
}

TEST_P(DeleteDirForcefully, TakesEveryOtherCharacter) {
  for (int character = 1; character < 256; ++character) {
    const char one = static_cast<char>(character);
    if (strchr("&;`'\"|*?~<>^()[]{}$\n\r\\/", one) != nullptr) continue;
    SCOPED_TRACE(character);
    std::string path = temp_.dir(std::string("x") + one + "x");
    const FakeSystem shell;
    EXPECT_TRUE(deleteDirForcefully(path.data()));
    EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  }
}

TEST_P(DeleteDirForcefully, OfAFileOrNothingIsAFailureWithoutAWord) {
  std::string file = temp_.file("file", "text");
  std::string absent = temp_.path("absent");
  char empty[] = "";
  const FakeSystem shell;

  EXPECT_FALSE(deleteDirForcefully(file.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isFileThere())));
  EXPECT_FALSE(deleteDirForcefully(absent.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, ENOENT))));
  EXPECT_FALSE(deleteDirForcefully(empty));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, ENOENT))));

  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, WherePermissionsHideThePathRunsNothing) {
  const std::string closed = temp_.dir("closed");
  std::string path = temp_.dir("closed/directory");
  ASSERT_EQ(chmod(closed.c_str(), 0000), 0);
  asOrdinaryUser([&] {
    const FakeSystem shell;
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, EACCES))));
    EXPECT_THAT(shell.commands(), IsEmpty());
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, WithoutACommandGoesOnToTheShellAllTheSame) {
  std::string path = temp_.dir("directory");
  const Trail said = joined(debug("deleteDirForcefully: vra_asprintf failed.\n"),
                            debug("deleteDirForcefully: command = '(null)'.\n"));
  {
    const FailingCall print(Call::vra_asprintf, ENOMEM);
    const FakeSystem shell(1);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    ASSERT_TRUE(print.fired());
    EXPECT_THAT(shell.commands(), ElementsAre(std::nullopt));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), said, forcedInVain(1))));
  }
  {
    const FailingCall print(Call::vra_asprintf, ENOMEM);
    const FakeSystem shell(0);
    EXPECT_FALSE(deleteDirForcefully(path.data())) << "0 says that there is no shell";
    EXPECT_THAT(shell.commands(), ElementsAre(std::nullopt));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), said, forcedInVain(0))));
  }
}

TEST_P(DeleteDirForcefully, WithoutACommandFailsWhereThereIsAShell) {
  std::string path = temp_.dir("directory");
  const FailingCall print(Call::vra_asprintf, ENOMEM);

  EXPECT_FALSE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 0, isThere(),
                        debug("deleteDirForcefully: vra_asprintf failed.\n"),
                        debug("deleteDirForcefully: command = '(null)'.\n"), forcedInVain(1))));
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, TakesTheCommandThatAFailedPrintLeft) {
  std::string path = temp_.dir("directory");
  const OddPrint print(-1);
  const FakeSystem shell;
  const LiveAllocations live;

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 1, isThere(),
                        debug("deleteDirForcefully: vra_asprintf failed.\n"), forced(path))));
}

TEST_P(DeleteDirForcefully, TakesAPrintThatAnswersAnotherNegativeNumber) {
  std::string path = temp_.dir("directory");
  const OddPrint print(-2);
  const FakeSystem shell;
  const LiveAllocations live;

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
}

// ---- Effects of the command ----

TEST_P(DeleteDirForcefully, RemovesAnEmptyDirectory) {
  std::string path = temp_.dir("directory");
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, RemovesASocket) {
  std::string path = temp_.path("socket");
  makeSocket(path);  // the type bits of a socket include that of a directory

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_FALSE(pathExists(path));
}

// With SIGCHLD ignored, the shell's exit status is lost.
TEST_P(DeleteDirForcefully, RemovesTheTreeButFailsWhereTheProcessIgnoresItsChildren) {
  std::string path = temp_.dir("tree");
  temp_.file("tree/file", "text");
  apart([&] {
    signal(SIGCHLD, SIG_IGN);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    signal(SIGCHLD, SIG_DFL);  // restored before this process ends
    EXPECT_EQ(trail(),
              traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(-1))));
  });
  EXPECT_FALSE(pathExists(path));
}

TEST_P(DeleteDirForcefully, RemovesATreeOf10000Entries) {
  std::string path = temp_.dir("tree");
  for (int directory = 0; directory < 100; ++directory) {
    const std::string name = "tree/" + std::to_string(directory);
    const std::string made = temp_.dir(name);
    for (int file = 0; file < 99; ++file) {
      const int descriptor = creat((made + "/" + std::to_string(file)).c_str(), 0444);
      ASSERT_NE(descriptor, -1);
      close(descriptor);
    }
  }
  temp_.dir("tree2");

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("tree2"));
}

TEST_P(DeleteDirForcefully, RemovesATreeDeeperThanAPathMayBeLong) {
  std::string path = temp_.dir("deep");
  apart([&] { EXPECT_EQ(enterDeep(path, 10'000).size(), 10'000U); });
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, LeavesWhatLinksInTheTreeLeadTo) {
  const std::string outside = temp_.dir("outside");
  const std::string file = temp_.file("outside/file", "text");
  std::string path = temp_.dir("tree");
  makeLink(outside, temp_.path("tree/directory"));
  makeLink("../outside", temp_.path("tree/relative"));
  makeLink(file, temp_.path("tree/file"));
  makeLink("/", temp_.path("tree/root"));
  makeLink("nowhere", temp_.path("tree/dangling"));
  ASSERT_EQ(link(file.c_str(), temp_.path("tree/hard").c_str()), 0);

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("outside"));
  EXPECT_THAT(namesIn(outside), ElementsAre("file"));
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, OfALinkToADirectoryRemovesTheLinkOnly) {
  const std::string directory = temp_.dir("directory");
  const std::string file = temp_.file("directory/file", "text");
  std::string path = temp_.path("link");
  makeLink(directory, path);

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_FALSE(pathExists(path));
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, AcceptsAnyNamesInsideTheTree) {
  std::string path = temp_.dir("tree");
  temp_.file("kept", "text");
  for (const char* const name :
       {"a name", " leading", "trailing ", "tab\there", "line\nbreak", "#hash", "-rf", "--", "*",
        "$HOME", "; rm kept", "`x`", "'", "\"", "\\", ".hidden", "..."}) {
    temp_.dir(std::string("tree/") + name);
    temp_.file(std::string("tree/") + name + "/" + name, "text");
  }

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("kept"));
}

TEST_P(DeleteDirForcefully, TakesATrailingSlash) {
  std::string path = temp_.dir("directory") + "/";
  temp_.file("directory/file", "text");
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, EmptiesTheTargetOfALinkWithATrailingSlash) {
  temp_.dir("target");
  temp_.file("target/file", "text");
  ASSERT_EQ(symlink("target", temp_.path("link").c_str()), 0);
  std::string path = temp_.path("link") + "/";
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), UnorderedElementsAre("link", "target"));
  EXPECT_THAT(namesIn(temp_.path("target")), IsEmpty());
}

TEST_P(DeleteDirForcefully, LeavesWhatItMayNotRemoveAndShowsTheRawStatus) {
  openToAll(temp_.path());
  std::string path = temp_.path("tree");
  asOrdinaryUser([&] {
    silence();
    makeDirectory(path);
    makeDirectory(path + "/read-only");
    makeDirectory(path + "/other");
    writeFile(path + "/read-only/file", "text");
    writeFile(path + "/other/file", "text");
    ASSERT_EQ(chmod((path + "/read-only").c_str(), 0555), 0);

    EXPECT_FALSE(deleteDirForcefully(path.data()));

    EXPECT_EQ(trail(),
              traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(256))));
    EXPECT_THAT(namesIn(path), ElementsAre("read-only"));
    EXPECT_EQ(contentsOf(path + "/read-only/file"), "text");
    EXPECT_EQ(chmod((path + "/read-only").c_str(), 0755), 0);
  });
}

TEST_P(DeleteDirForcefully, SplitsAPathAtBlanksAndTabs) {
  for (const std::string blank : {" ", "\t", "  ", " \t "}) {
    const TempDir place;
    apart([&] {
      enter(place.path());
      std::string path = "one" + blank + "two";
      for (const std::string& name : {std::string("one"), std::string("two"), path}) {
        makeDirectory(name);
      }
      {
        const FakeSystem shell;
        EXPECT_TRUE(deleteDirForcefully(path.data()));
        EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
      }
      records_.clear();
      EXPECT_TRUE(deleteDirForcefully(path.data()));
      EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
      EXPECT_THAT(namesIn("."), ElementsAre(path));
    });
  }
}

TEST_P(DeleteDirForcefully, TakesAWordThatBeginsWithAHashForAComment) {
  apart([&] {
    enter(temp_.path());
    char hash[] = "#directory";
    makeDirectory(hash);
    {
      const FakeSystem shell;
      EXPECT_TRUE(deleteDirForcefully(hash));
      EXPECT_THAT(shell.commands(), ElementsAre("rm -rf #directory"));
    }
    EXPECT_TRUE(deleteDirForcefully(hash)) << "the command has nothing to do";
    EXPECT_THAT(namesIn("."), ElementsAre("#directory"));

    char second[] = "one #two three";
    for (const std::string name : {"one", "#two", "two", "three", "one #two three"})
      makeDirectory(name);
    EXPECT_TRUE(deleteDirForcefully(second));
    EXPECT_THAT(namesIn("."),
                UnorderedElementsAre("#directory", "#two", "two", "three", "one #two three"));

    char inside[] = "in#side";
    makeDirectory(inside);
    EXPECT_TRUE(deleteDirForcefully(inside));
    EXPECT_FALSE(pathExists(inside)) << "no comment inside a word";
  });
}

TEST_P(DeleteDirForcefully, FindsRmThroughTheProgramsPath) {
  apart([&] {
    const std::string seen = temp_.path("seen");
    const std::string programs = temp_.dir("programs");
    const std::string rm = temp_.file("programs/rm", "#!/bin/sh\necho \"$@\" > " + seen + "\n");
    ASSERT_EQ(chmod(rm.c_str(), 0755), 0);
    std::string path = temp_.dir("tree");
    ASSERT_EQ(setenv("PATH", programs.c_str(), 1), 0);

    EXPECT_TRUE(deleteDirForcefully(path.data()));

    EXPECT_EQ(contentsOf(seen), "-rf " + path + "\n");
    EXPECT_TRUE(pathExists(path));
  });
}

TEST_P(DeleteDirForcefully, TakesAWordThatBeginsWithADashForAnOption) {
  apart([&] {
    silence();
    enter(temp_.path());
    char verbose[] = "-v";
    char unknown[] = "--no-such-option";
    makeDirectory(verbose);
    makeDirectory(unknown);

    EXPECT_TRUE(deleteDirForcefully(verbose)) << "the command has nothing to do";
    records_.clear();
    EXPECT_FALSE(deleteDirForcefully(unknown));

    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), forced(unknown),
                                   forcedInVain(256))));
    EXPECT_THAT(namesIn("."), UnorderedElementsAre("-v", "--no-such-option"));
  });
}

}  // namespace
