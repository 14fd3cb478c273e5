#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_registryutils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;

namespace {

// ---- Unreadable files ----

TEST_F(GetXQ4PathAndVersion, LooksBelowTheProductsPlaceWhenNothingIsSet) {
  const FailingCall query(Call::stat64, ENOENT);  // independent of what this machine has there
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(query.fired());
  EXPECT_EQ(records.trail(), discovery(installPath(), exists(false),
                                       missing("/opt/orx/ldap/V6.1/etc/ldapdb.properties")));
}

TEST_F(GetXQ4PathAndVersion, OfAFileInADirectoryThatMayNotBeSearchedSaysSo) {
  REQUIRE_ROOT("to become another user");
  const std::string file = migrationFile(kBothLines);
  ASSERT_EQ(chmod(temp_.path("etc").c_str(), 0700), 0);

  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     const Records records;
                     EXPECT_EQ(find(), kNothing);
                     EXPECT_EQ(records.trail(),
                               discovery(call("doesFileExist", 0,
                                              debug("doesFileExist: stat() - errno=13\n")),
                                         missing(file)));
                     return 0;
                   }),
            0);
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatPermissionsHideAfterAllSaysSo) {
  const std::string file = migrationFile(kBothLines);
  const FailingCall query(Call::stat64, EACCES, 2);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(query.fired());
  EXPECT_EQ(
      records.trail(),
      discovery(readable(), call("canAccessFile", 0, debug("canAccessFile: stat() - errno=13\n")),
                missing(file)));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatDisappearsBeforeItIsOpenedIsNullAndSilent) {
  const std::string file = migrationFile(kBothLines);
  const BeforeCall opening(Call::fopen64, [&] { unlink(file.c_str()); });
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(opening.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatMayNotBeReadIsNullAndSilent) {
  REQUIRE_ROOT("to become another user");
  const std::string file = migrationFile(kBothLines);
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);

  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     const Records records;
                     EXPECT_EQ(find(), kNothing);
                     EXPECT_EQ(records.trail(), silence());
                     return 0;
                   }),
            0);
}

TEST_F(GetXQ4PathAndVersion, ThatCannotOpenItsFileIsNullAndSilent) {
  migrationFile(kBothLines);
  for (const int reason : {ENOMEM, EMFILE, EIO}) {
    const FailingCall opening(Call::fopen64, reason);
    const Records records;

    EXPECT_EQ(find(), kNothing);

    ASSERT_TRUE(opening.fired());
    EXPECT_EQ(records.trail(), silence());
  }
}

TEST_F(GetXQ4PathAndVersion, OfADirectoryInTheFilesPlaceIsNullAndSilent) {
  temp_.dir("etc");
  temp_.dir("etc/xq4info");
  forMigration();
  const Records records;

  EXPECT_EQ(find(), kNothing);
  EXPECT_EQ(findPath(), "(none)");

  EXPECT_EQ(records.trail(), joined(silence(), silence()));
}

TEST_F(GetXQ4PathAndVersion, FollowsALinkToItsFile) {
  temp_.dir("etc");
  const std::string target = temp_.file("elsewhere", kBothLines);
  ASSERT_EQ(symlink(target.c_str(), temp_.path("etc/xq4info").c_str()), 0);
  forMigration();

  EXPECT_EQ(find(), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, KeepsItsFileFromProgramsThatAreStartedMeanwhile) {
  migrationFile(kBothLines);
  int descriptors = 0;
  const BeforeCall closing(Call::fclose, [&] {
    for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;  // set for the iterator's own descriptor
      if (std::filesystem::read_symlink(each, gone) != temp_.path("etc/xq4info")) continue;
      ++descriptors;
      const int descriptor = std::stoi(each.path().filename());
      EXPECT_EQ(fcntl(descriptor, F_GETFD), FD_CLOEXEC);
    }
  });

  EXPECT_EQ(find(), kBothFound);

  ASSERT_TRUE(closing.fired());
  EXPECT_EQ(descriptors, 1);
}

TEST_F(GetXQ4PathAndVersion, ThatCannotReadAtAllIsNullAndSilent) {
  migrationFile(kBothLines);
  const FailingCall reading(Call::fread, EIO);
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(reading.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALineThatAReadErrorCuts) {
  // As whole lines, "9.1" and "/opt/xq" would be valid.
  const std::string cut_version = "currentXQ4Version=9.1";
  migrationFile(kPathLine + fillerLines(kBlock - strlen(kPathLine) - cut_version.size()) +
                cut_version + ".0.2\n");
  {
    const FailingCall reading(Call::fread, EIO, 2);
    EXPECT_EQ(find(), kNothing);
    ASSERT_TRUE(reading.fired());
  }
  EXPECT_EQ(find(), kBothFound);

  const std::string cut_path = "currentXQ4InstallPath=/opt/xq";
  migrationFile(kVersionLine + fillerLines(kBlock - strlen(kVersionLine) - cut_path.size()) +
                cut_path + "4/V9.1\n");
  {
    const FailingCall reading(Call::fread, EIO, 2);
    EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));
    ASSERT_TRUE(reading.fired());
    EXPECT_EQ(findPath(), "/opt/xq4/V9.1");
  }
  EXPECT_EQ(find(), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALineOfTheGreatestLengthWhoseEndCannotBeRead) {
  const std::string line = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  migrationFile(line + "\n" + kVersionLine);
  {
    const CutRead reading(kLongestLine);
    EXPECT_EQ(find(), kNothing);
    ASSERT_TRUE(reading.fired());
  }
  EXPECT_EQ(find(), (Found{line.substr(line.find('=') + 1), "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, TakesAWholeLineBeforeAReadError) {
  const std::string before = fillerLines(kBlock - kBothLines.size()) + kBothLines;
  migrationFile(before + "currentXQ4Version=bad\n");
  const FailingCall reading(Call::fread, EIO, 2);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_TRUE(reading.fired());
}

TEST_F(GetXQ4PathAndVersion, TakesTheWholeLinesOfABlockThatAReadErrorCuts) {
  migrationFile(kBothLines + fillerLines(100) + kBothLines);
  {
    const CutRead reading(kBothLines.size() + 10);
    const FailingCall blocks(Call::fread, 0, kNever);
    EXPECT_EQ(find(), kBothFound);
    EXPECT_TRUE(reading.fired());
    EXPECT_EQ(blocks.calls(), 1);  // and no further read
  }
  const std::string cut_version = "currentXQ4Version=9.1";
  migrationFile(kPathLine + cut_version + ".0.2\n");
  const CutRead reading(strlen(kPathLine) + cut_version.size());
  EXPECT_EQ(find(), kNothing);
  EXPECT_TRUE(reading.fired());
}

TEST_F(GetXQ4PathAndVersion, KeepsWhatItFoundBeforeAReadError) {
  migrationFile(kBothLines + fillerLines(3 * kBlock));
  for (int block = 2; block <= 4; ++block) {
    const FailingCall reading(Call::fread, EIO, block);

    EXPECT_EQ(find(), kBothFound);

    EXPECT_TRUE(reading.fired());
    EXPECT_EQ(reading.calls(), block);  // and no further read
  }
}

TEST_F(GetXQ4PathAndVersion, IgnoresACloseThatFails) {
  migrationFile(kBothLines);
  const FailingCall closing(Call::fclose, EIO);
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(closing.calls(), 1);
  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.1.0.2\n"));
}

TEST_F(GetXQ4PathAndVersion, ClosesTheFileAfterAFailure) {
  migrationFile("currentXQ4Version=bad\n");
  const FailingCall closing(Call::fclose, 0, kNever);

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));
  EXPECT_EQ(closing.calls(), 1);

  expectComplaint(temp_.path("etc/xq4info"));
}

// ---- Failing allocations ----

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForTheVersionReadsNoFurther) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kVersionLine + kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), silence());
  EXPECT_EQ(live.blocks(), 1);
}

// The path is copied last, whichever line is first.
TEST_F(GetXQ4PathAndVersion, CopiesTheVersionBeforeThePath) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForThePathSaysSoAndKeepsTheVersion) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM, 2);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true),
                      call("getShortname", 0, debug("getShortname: passed a null pointer.\n")),
                      error("getXQ4PathAndVersion: path4 is NULL\n")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForTheAnswerSaysSoAndKeepsTheVersion) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM, 3);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname(),
                      error("getXQ4PathAndVersion: path4 is NULL\n")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetXQ4PathAndVersion, MakesNoOtherAllocations) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall allocation(Call::allocation, 0, kNever);
  const FailingCall print(Call::vra_asprintf, 0, kNever);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(allocation.calls(), 3);
  EXPECT_EQ(print.calls(), 1);
}

TEST_F(GetXQ4PathAndVersion, KeepsThePathThatItDoesNotAnswer) {
  REQUIRE_OWN_MALLOC();
  // With a path, with a file without a path, and with a file that cannot be read.
  for (const char* const contents : {kPathLine, kVersionLine, ""}) {
    SCOPED_TRACE(contents);
    migrationFile(contents);
    const LiveAllocations live;
    for (int calls = 1; calls <= 5; ++calls) {
      EXPECT_EQ(find().path, "(none)");
      EXPECT_EQ(live.blocks(), calls);
    }
  }
  const FailingCall opening(Call::fopen64, EIO);
  const LiveAllocations live;
  EXPECT_EQ(findPath(), "(none)");
  EXPECT_TRUE(opening.fired());
  EXPECT_EQ(live.blocks(), 1);
}

}  // namespace
