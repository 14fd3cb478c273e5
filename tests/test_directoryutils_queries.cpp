#include <errno.h>
#include <gmock/gmock.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_directoryutils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;

namespace {

constexpr long kMiB = 1 << 20;

// ---- Fixture ----

// Returns a copy of the string and frees the original.
std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

TRACED_AND_NOT(FixedAnswers);
TRACED_AND_NOT(CurrentWorkingDirectory);
TRACED_AND_NOT(IsEnoughDriveSpace);
TRACED_AND_NOT(TrimLastDirectory);

// ---- getTempDir, getSystemDrive, getLocalDrives, getShortname ----

TEST_P(FixedAnswers, NameTheTemporaryDirectoryAndTheRoot) {
  EXPECT_EQ(taken(getTempDir()), "/tmp");
  EXPECT_EQ(trail(), traced(no("getTempDir")));
  EXPECT_EQ(taken(getSystemDrive()), "/");
  EXPECT_EQ(trail(), traced(no("getSystemDrive")));
}

TEST_P(FixedAnswers, DoNotFollowTheEnvironment) {
  apart([] {
    ASSERT_EQ(setenv("TMPDIR", "/var/tmp", 1), 0);
    EXPECT_EQ(taken(getTempDir()), "/tmp");
  });
}

TEST_P(FixedAnswers, SayThatThereAreNoDrives) {
  EXPECT_EQ(getLocalDrives(), 0);
  EXPECT_EQ(trail(),
            traced(call("getLocalDrives", 0,
                        debug("getLocalDrives: function not implemented on UNIX platforms.\n"))));
}

TEST_P(FixedAnswers, CopyANameForItsShortOne) {
  const std::string name = "/a name/with \\ all\tof it/";
  char* const copy = getShortname(name.c_str());
  EXPECT_NE(copy, name.c_str());
  EXPECT_EQ(taken(copy), name);
  EXPECT_EQ(trail(), traced(no("getShortname")));
  EXPECT_EQ(taken(getShortname("")), "");
}

TEST_P(FixedAnswers, RefuseANullName) {
  EXPECT_EQ(getShortname(nullptr), nullptr);
  EXPECT_EQ(trail(),
            traced(call("getShortname", 0, debug("getShortname: passed a null pointer.\n"))));
}

TEST_P(FixedAnswers, AreNewStrings) {
  REQUIRE_OWN_MALLOC();
  const std::function<char*()> asked[] = {getTempDir, getSystemDrive,
                                          [] { return getShortname("name"); }};
  for (const auto& ask : asked) {
    const LiveAllocations live;
    char* const first = ask();
    char* const second = ask();
    EXPECT_NE(first, second);
    EXPECT_EQ(live.blocks(), 2);
    free(first);
    free(second);
    EXPECT_EQ(live.blocks(), 0);
  }
}

TEST_P(FixedAnswers, AreNullWithoutMemory) {
  REQUIRE_OWN_MALLOC();
  const auto without_memory = [](const std::function<char*()>& ask) {
    FailingCall copy(Call::strdup, ENOMEM);
    char* const answer = ask();
    copy.disarm();
    EXPECT_TRUE(copy.fired());
    return answer;
  };

  EXPECT_EQ(without_memory(getTempDir), nullptr);
  EXPECT_EQ(without_memory(getSystemDrive), nullptr);
  EXPECT_EQ(without_memory([] { return getShortname("name"); }), nullptr);

  EXPECT_EQ(trail(), traced(no("getTempDir"), no("getSystemDrive"), no("getShortname")));
}

// ---- getCurrentWorkingDirectory ----

TEST_P(CurrentWorkingDirectory, IsWhereTheProcessIs) {
  const std::string place = std::filesystem::canonical(temp_.dir("a place")).string();
  makeLink(place, temp_.path("link"));
  apart([&] {
    enter(temp_.path("link"));
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), place);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
    enter("/");
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), "/");
  });
}

TEST_P(CurrentWorkingDirectory, IsANewString) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  char* const path = getCurrentWorkingDirectory();
  EXPECT_EQ(live.blocks(), 1);
  free(path);
  EXPECT_EQ(live.blocks(), 0);
}

TEST_P(CurrentWorkingDirectory, IsNullWithoutAWordWhenTheSystemDoesNotTell) {
  const FailingCall asked(Call::getcwd, EACCES);
  EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
  ASSERT_TRUE(asked.fired());
  EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
}

TEST_P(CurrentWorkingDirectory, IsNullWhenItWasRemoved) {
  const std::string place = temp_.dir("place");
  apart([&] {
    enter(place);
    ASSERT_EQ(rmdir(place.c_str()), 0);
    EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
  });
}

TEST_P(CurrentWorkingDirectory, MayHave8191BytesAndNoMore) {
  const std::string place = std::filesystem::canonical(temp_.path()).string();
  apart([&] {
    const std::string path = enterDeep(place, 8191);
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), path);
  });
  const std::string other = std::filesystem::canonical(temp_.dir("other")).string();
  apart([&] {
    EXPECT_EQ(enterDeep(other, 8192).size(), 8192U);
    records_.clear();
    EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
  });
}

// ---- isEnoughDriveSpace ----

TEST_P(IsEnoughDriveSpace, RefusesANullPath) {
  EXPECT_FALSE(isEnoughDriveSpace(0, nullptr));
  EXPECT_EQ(trail(), traced(call("isEnoughDriveSpace", 0,
                                 debug("isEnoughDriveSpace: passed a null pointer.\n"))));
}

TEST_P(IsEnoughDriveSpace, IsAlwaysThereForNothing) {
  for (const long required : {0L, -1L, LONG_MIN}) {
    std::string directory = temp_.path();
    EXPECT_TRUE(isEnoughDriveSpace(required, directory.data()));
    EXPECT_EQ(trail(), traced(yes("isEnoughDriveSpace")));
    char without_space[] = "/proc";
    EXPECT_TRUE(isEnoughDriveSpace(required, without_space));
    trail();
  }
}

TEST_P(IsEnoughDriveSpace, IsThereForNothingOnTheLargestFileSystems) {
  REQUIRE_ROOT("to mount a large file system");
  const std::string large = temp_.dir("large");
  EXPECT_EQ(withPrivateMounts([&] {
              for (const char* size : {"size=7E", "size=8E", "size=9E", "size=15E"}) {
                SCOPED_TRACE(size);
                if (mount("none", large.c_str(), "tmpfs", 0, size) != 0) return 2;
                for (const long required : {0L, -1L, LONG_MIN}) {
                  std::string path = large;
                  EXPECT_TRUE(isEnoughDriveSpace(required, path.data())) << required;
                }
              }
              return 0;
            }),
            0);
}

TEST_P(IsEnoughDriveSpace, IsNeverThereForEverything) {
  std::string path = temp_.path();
  EXPECT_FALSE(isEnoughDriveSpace(LONG_MAX, path.data()));
  EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, IsNotThereWhereNothingIsStored) {
  char without_space[] = "/proc";
  EXPECT_FALSE(isEnoughDriveSpace(1, without_space));
  EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, OfAMissingPathIsAFailureWithoutAWord) {
  std::string path = temp_.path("missing");
  char empty[] = "";
  for (const long required : {0L, -1L, 1L}) {
    EXPECT_FALSE(isEnoughDriveSpace(required, path.data()));
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
    EXPECT_FALSE(isEnoughDriveSpace(required, empty));
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
  }
}

TEST_P(IsEnoughDriveSpace, CountsWholeMiBThatAreFree) {
  REQUIRE_ROOT("to mount a small file system");
  const std::string small = temp_.dir("small");
  makeLink(small, temp_.path("link"));
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", small.c_str(), "tmpfs", 0, "size=4m"), 0);
              const std::string file = small + "/file";
              struct Case {
                long used;
                long free_mib;
              };
              const long page = sysconf(_SC_PAGESIZE);
              for (const Case& each : {Case{0, 4}, Case{1, 3}, Case{kMiB, 3}, Case{kMiB + 1, 2},
                                       Case{4 * kMiB - page, 0}, Case{4 * kMiB, 0}}) {
                SCOPED_TRACE(each.used);
                writeFile(file, std::string(static_cast<size_t>(each.used), 'x'));
                for (std::string path : {small, file, temp_.path("link")}) {
                  EXPECT_TRUE(isEnoughDriveSpace(each.free_mib, path.data()));
                  EXPECT_TRUE(isEnoughDriveSpace(each.free_mib - 1, path.data()));
                  EXPECT_FALSE(isEnoughDriveSpace(each.free_mib + 1, path.data()));
                }
              }
              return 0;
            }),
            0);
}

TEST_P(IsEnoughDriveSpace, CountsNoSpaceThatIsKeptForRoot) {
  struct statvfs space = {};
  ASSERT_EQ(statvfs(temp_.path().c_str(), &space), 0);
  const auto mib = [&](fsblkcnt_t blocks) {
    return static_cast<long>(blocks * space.f_frsize / static_cast<unsigned long>(kMiB));
  };
  const long for_all = mib(space.f_bavail);
  const long for_root = mib(space.f_bfree);
  // Other processes may write here meanwhile, so the requested size is far from the free space.
  if (for_root - for_all < 1024) GTEST_SKIP() << temp_.path() << " keeps little space for root";
  std::string path = temp_.path();

  EXPECT_FALSE(isEnoughDriveSpace(for_all + (for_root - for_all) / 2, path.data()));
}

TEST_P(IsEnoughDriveSpace, IsTheBlocksForAllTimesTheBlockSize) {
  std::string path = temp_.path();
  const auto expectMiB = [&](long mib) {
    EXPECT_TRUE(isEnoughDriveSpace(mib, path.data())) << mib;
    EXPECT_FALSE(isEnoughDriveSpace(mib + 1, path.data())) << mib;
  };
  {
    const FakeStatfs space(5, 500, kMiB, kMiB);
    expectMiB(5);
  }
  {
    const FakeStatfs space(5, 5, kMiB, 4096);
    expectMiB(5);
  }
  {
    const FakeStatfs space(2559, 2559, 4096, kMiB);
    expectMiB(9);
  }
  const FakeStatfs space(0x7fffffff, 0x7fffffff, 0x7fffffff, 512);  // more than 32 bits
  expectMiB(0x3fffffff00000001 / kMiB);
}

TEST_P(IsEnoughDriveSpace, IsASignedNumberOfBytes) {
  std::string path = temp_.path();
  const FakeStatfs space((1UL << 43) + 1, (1UL << 43) + 1, kMiB, kMiB);  // 2^63 bytes and 1 MiB

  EXPECT_FALSE(isEnoughDriveSpace(1, path.data()));
  EXPECT_TRUE(isEnoughDriveSpace(1 - (1L << 43), path.data()));
}

TEST_P(IsEnoughDriveSpace, IsCutOffTowardsZeroBelowZeroToo) {
  std::string path = temp_.path();
  const FakeStatfs space(~0UL, ~0UL, kMiB - 1, kMiB - 1);  // one byte more than -1 MiB

  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));
  EXPECT_FALSE(isEnoughDriveSpace(1, path.data()));
}

TEST_P(IsEnoughDriveSpace, TakesAPrintThatAnswersAnotherNegativeNumber) {
  std::string path = temp_.path();
  const OddPrint print(-2);
  const LiveAllocations live;

  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(trail(), traced(yes("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, ReportsThatThePathCannotBeCopied) {
  std::string path = temp_.path();
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const FailingCall asked(Call::statfs, 0, kNever);

  EXPECT_FALSE(isEnoughDriveSpace(0, path.data()));

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(asked.calls(), 0);
  EXPECT_EQ(trail(), traced(call("isEnoughDriveSpace", 0,
                                 debug("isEnoughDriveSpace: vra_asprintf failed.\n"))));
}

TEST_P(IsEnoughDriveSpace, FreesItsCopyWhateverTheAnswer) {
  std::string path = temp_.path();
  const LiveAllocations live;
  {
    const FailingCall asked(Call::statfs, EIO);
    EXPECT_FALSE(isEnoughDriveSpace(0, path.data()));
    ASSERT_TRUE(asked.fired());
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
  }
  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));
  EXPECT_FALSE(isEnoughDriveSpace(LONG_MAX, path.data()));
  EXPECT_EQ(live.blocks(), 0);
}

// ---- trimLastDirectory ----

TEST_P(TrimLastDirectory, RefusesANullPointer) {
  EXPECT_EQ(trimLastDirectory(nullptr), 1);
  EXPECT_EQ(trail(),
            traced(call("trimLastDirectory", 1, debug("trimLastDirectory: path is null.\n"))));
}

TEST_P(TrimLastDirectory, LeavesANullStringAlone) {
  char* path = nullptr;
  EXPECT_EQ(trimLastDirectory(&path), 0);
  EXPECT_EQ(path, nullptr);
  EXPECT_EQ(trail(), traced(no("trimLastDirectory")));
}

TEST_P(TrimLastDirectory, CutsAtTheLastSlashAfterTheFirstCharacter) {
  struct Case {
    const char* path;
    const char* trimmed;
  };
  for (const Case& each : {
           Case{"/usr/lib", "/usr"},
           Case{"/usr", ""},
           Case{"usr/lib/", "usr/lib"},
           Case{"name", ""},
           Case{"", ""},
           Case{"/", ""},
           Case{"//", "/"},
           Case{"///", "//"},
           Case{"a", ""},
           Case{"a/", "a"},
           Case{"a/b", "a"},
           Case{"/a/", "/a"},
           Case{"//a", "/"},
           Case{"/usr//lib", "/usr/"},
           Case{"/usr/lib//", "/usr/lib/"},
           Case{"./a", "."},
           Case{"../a/..", "../a"},
           Case{"\\usr\\lib", ""},
           Case{"/usr/a\\b", "/usr"},
       }) {
    SCOPED_TRACE(each.path);
    std::string text = each.path;
    char* path = text.data();
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_EQ(path, text.data());
    EXPECT_STREQ(path, each.trimmed);
    EXPECT_EQ(trail(), traced(no("trimLastDirectory")));
    // Only one byte is written.
    const size_t cut = strlen(each.trimmed);
    std::string expected = each.path;
    if (cut < expected.size()) expected[cut] = '\0';
    EXPECT_EQ(text, expected);
  }
}

TEST_P(TrimLastDirectory, EmptiesAPathStepByStep) {
  std::string text = "/opt/a/b";
  char* path = text.data();
  for (const char* const trimmed : {"/opt/a", "/opt", "", ""}) {
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_STREQ(path, trimmed);
  }
}

// ---- Trace classes ----

void callAll(const TempDir& temp) {
  std::string path = temp.path("x");
  free(getTempDir());
  free(getSystemDrive());
  getLocalDrives();
  free(getShortname("x"));
  free(getCurrentWorkingDirectory());
  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0755));
  EXPECT_TRUE(deleteDirectory(path.c_str()));
  EXPECT_FALSE(deleteDirForcefully(path.data()));
  EXPECT_EQ(createSymLink("target", path.c_str()), 0);
  EXPECT_EQ(removeSymLink(path.c_str()), 0);
  EXPECT_TRUE(isEnoughDriveSpace(0, std::string(temp.path()).data()));
  char* trimmed = path.data();
  EXPECT_EQ(trimLastDirectory(&trimmed), 0);
}

TEST(DirectoriesTrace, HasTrimLastDirectoryInAClassOfItsOwn) {
  const TempDir temp;
  {
    const Records records(kEntryExit43 | kExitError43);
    callAll(temp);
    char* path = nullptr;
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_EQ(trimLastDirectory(nullptr), 1);
    EXPECT_THAT(records.trail(), ElementsAre("> trimLastDirectory", "< trimLastDirectory 0",
                                             "> trimLastDirectory", "< trimLastDirectory 0",
                                             "> trimLastDirectory", "<! trimLastDirectory 1"));
  }
  const Records records(kEntryExit33 | kExitError33);
  callAll(temp);
  EXPECT_EQ(records.trail(),
            joined(no("getTempDir"), no("getSystemDrive"), no("getLocalDrives"), no("getShortname"),
                   no("getCurrentWorkingDirectory"),
                   call("createDirectory", 1, no("doesFileExist"), yes("canAccessFile"),
                        yes("setFileOwnersAndPermissions")),
                   removed(), call("deleteDirForcefully", 0, no("doesFileExist")),
                   no("createSymLink"), no("removeSymLink"), yes("isEnoughDriveSpace")));
}

}  // namespace
