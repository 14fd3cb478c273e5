// line_file, tested through both editors: reading by lines, appending, backup and rewriting, also on
// full disks, across power failures, in cancelled threads and on small stacks.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "cancelled.h"
#include "editors.h"
#include "faults.h"
#include "power_failure.h"
#include "records.h"
#include "small_stack.h"
#include "trails.h"
#include "world.h"

using testing::Contains;
using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

namespace {

// ---- Fixture ----

constexpr size_t kSmallDiskBytes = 64 * 1024;

template <typename Editor>
class LineFileTest : public EditorTest<Editor> {
 protected:
  // Mounts a tmpfs of this size in the mount table of a child.
  static bool mountSmallDisk(const std::string& directory, size_t bytes) {
    const std::string options = "size=" + std::to_string(bytes);
    return mount("osutils-test", directory.c_str(), "tmpfs", 0, options.c_str()) == 0;
  }

  // More than fits on a disk of 16 KiB.
  std::string manyLines() const {
    std::string lines = this->alpha_line;
    while (lines.size() < 40000) lines += this->beta_line;
    return lines;
  }
};
TYPED_TEST_SUITE(LineFileTest, BothEditors, );  // clang warns about fewer arguments

// ---- Reading by lines ----

TYPED_TEST(LineFileTest, LongLinesComeInTheSamePiecesWhereverABlockOfTheFileEnds) {
  for (const size_t block_bytes : {2048U, 4096U, 16384U}) {
    for (size_t in_first_block = 1015; in_first_block <= 1030; ++in_first_block) {
      SCOPED_TRACE(std::to_string(block_bytes) + " " + std::to_string(in_first_block));
      EXPECT_THAT(this->loaded(std::string(block_bytes - in_first_block, '\n') +
                               std::string(1021, ' ') + "##" + this->alpha_line + this->beta_line),
                  ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
    }
  }
}

TYPED_TEST(LineFileTest, WaitsAtAPipeAndLoadsWhatAWriterSends) {
  ASSERT_EQ(mkfifo(this->path.c_str(), 0600), 0);
  TypeParam editor;
  // The writer starts when the library opens the pipe.
  std::thread writer;
  const BeforeCall open(Call::fopen64, [&] {
    writer = std::thread([&] {
      std::ofstream pipe(this->path);
      pipe << this->alpha_line << this->beta_line.substr(0, 2) << std::flush
           << this->beta_line.substr(2) << std::string(20000, '#') << "\n"
           << this->gamma_line.substr(0, this->gamma_line.size() - 1);
    });
  });

  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);

  ASSERT_TRUE(open.fired());
  writer.join();
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta, TypeParam::kGamma));
}

TYPED_TEST(LineFileTest, ReadErrorEndsTheFile) {
  std::string contents = this->alpha_line;
  while (contents.size() < 40000) contents += "# filling the first blocks\n";
  writeFile(this->path, contents + this->beta_line);
  TypeParam editor;
  {
    const FailingCall read(Call::fread, EIO);
    EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
    ASSERT_TRUE(read.fired());
    EXPECT_THAT(listOf(editor), IsEmpty());
  }
  const FailingCall read(Call::fread, EIO, 2);
  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
  ASSERT_TRUE(read.fired());
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
}

// ---- Appending ----

TYPED_TEST(LineFileTest, AddToAFullDiskIsNotReported) {
  REQUIRE_ROOT("for a small file system");
  const std::string disk = this->temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!this->mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/file";
              writeFile(small, "");
              std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              this->pointAt(small, this->backup);
              TypeParam editor;

              EXPECT_EQ(editor.add(TypeParam::kAlpha), OSUTILS_SUCCESS);

              EXPECT_EQ(contentsOf(small), "");
              EXPECT_TRUE(editor.lists(TypeParam::kAlpha));
              return 0;
            }),
            0);
}

// ---- Rewriting ----

TYPED_TEST(LineFileTest, DeletesTheLineAndTheRecord) {
  writeFile(this->path, this->alpha_line + this->beta_line + this->gamma_line);
  TypeParam editor;
  editor.read();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;

  EXPECT_EQ(editor.remove(TypeParam::kBeta), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(this->path), this->alpha_line + this->gamma_line);
  EXPECT_FALSE(pathExists(this->backup));
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kGamma));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::deleting(
                  0, TypeParam::kListed + kGoodFile + copiedToNewFile() + kDeleted)));
}

TYPED_TEST(LineFileTest, FreesTheDeletedRecord) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path, this->alpha_line + this->beta_line);
  const LiveAllocations memory;
  TypeParam editor;
  editor.read();
  EXPECT_EQ(memory.blocks(), 3);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  EXPECT_EQ(memory.blocks(), 2);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kBeta));
}

TYPED_TEST(LineFileTest, DeleteAnswersWhatTheFileIs) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  ASSERT_EQ(unlink(this->path.c_str()), 0);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_NO_SUCH_OBJECT);
  ASSERT_EQ(mkdir(this->path.c_str(), 0755), 0);
  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
  EXPECT_FALSE(pathExists(this->backup));
}

TYPED_TEST(LineFileTest, DeleteFromALinkEditsItsTarget) {
  const std::string target = this->temp.file("target", this->alpha_line + this->beta_line);
  ASSERT_EQ(chmod(target.c_str(), 0604), 0);
  ASSERT_EQ(symlink(target.c_str(), this->path.c_str()), 0);
  TypeParam editor;
  editor.read();

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  EXPECT_TRUE(std::filesystem::is_symlink(this->path));
  EXPECT_EQ(contentsOf(target), this->beta_line);
  EXPECT_EQ(modeOf(target), 0604U);
}

TYPED_TEST(LineFileTest, DeleteByAUserWhoMayNotWriteChangesNothing) {
  REQUIRE_ROOT("to become another user");
  const std::string contents = this->alpha_line;
  writeFile(this->path, contents);
  ASSERT_EQ(chmod(this->path.c_str(), 0644), 0);
  const std::string open_to_all = this->temp.dir("open");
  ASSERT_EQ(chmod(open_to_all.c_str(), 0777), 0);
  const std::string writable_backup = open_to_all + "/backup";
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     TypeParam editor;
                     EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
                     EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_FALSE(pathExists(this->backup));

                     // The backup can be made here, but the file cannot be written.
                     TypeParam::fileBackup() = writable_backup.c_str();
                     const Records records;
                     EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_FALSE(pathExists(writable_backup));
                     const Trail tail = Trail{"D " + TypeParam::deleteOpenFailed(EACCES)} +
                                        kDeleted + Trail{TypeParam::deleting(50).back()};
                     const Trail trail = records.trail();
                     EXPECT_GT(trail.size(), tail.size());
                     EXPECT_EQ(Trail(trail.end() - static_cast<long>(tail.size()), trail.end()),
                               tail);
                     EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(this->path), contents);
}

TYPED_TEST(LineFileTest, DeleteWhenTheBackupOrTheFileCannotBeOpened) {
  const std::string contents = this->alpha_line + this->beta_line;
  const struct {
    bool backup_fails;
    bool file_fails;
    int error;
    std::string left;
  } cases[] = {
      {true, false, EMFILE, ""},  // opening the file has emptied it
      {false, true, ENFILE, contents},
      {true, true, ENFILE, contents},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(std::to_string(with.backup_fails) + " " + std::to_string(with.file_fails));
    writeFile(this->path, contents);
    TypeParam editor;
    editor.read();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const Records records;
    const FailingCall backup_open(Call::fopen64, EMFILE, with.backup_fails ? 3 : kNever);
    const FailingCall file_open(Call::fopen64, ENFILE, with.file_fails ? 4 : kNever);

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(backup_open.calls(), 4) << "both are opened before either is checked";
    EXPECT_EQ(contentsOf(this->path), with.left);
    EXPECT_FALSE(pathExists(this->backup));
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::deleting(
                    50, TypeParam::kListed + kGoodFile + copiedToNewFile() +
                            Trail{"D " + TypeParam::deleteOpenFailed(with.error)} + kDeleted)));
  }
}

TYPED_TEST(LineFileTest, DeleteKeepsTheBackupOfALineThatCouldNotBeWritten) {
  const std::string contents = this->alpha_line + this->beta_line + this->gamma_line;
  const struct {
    Call call;
    int nth;
    std::string left;
  } cases[] = {
      {Call::fwrite, 1, this->gamma_line},
      {Call::fwrite, 2, this->beta_line},
      {Call::fclose, 4,
       this->beta_line + this->gamma_line},  // after two of the copy and one of the backup
      {Call::fread, 1, ""},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.left);
    writeFile(this->path, contents);
    TypeParam editor;
    editor.read();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(this->path), with.left);
    EXPECT_EQ(contentsOf(this->backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_THAT(listOf(editor),
                ElementsAre(TypeParam::kAlpha, TypeParam::kBeta, TypeParam::kGamma));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::deleting(
                    50, TypeParam::kListed + kGoodFile + copiedToNewFile() +
                            // The copy back from the backup.
                            Trail{"D " + TypeParam::copyFailed(this->backup, this->path)})));
    ASSERT_EQ(unlink(this->backup.c_str()), 0);
  }
}

TYPED_TEST(LineFileTest, DeleteKeepsTheBackupWhenTheDiskFillsUpMeanwhile) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = this->manyLines();
  const std::string disk = this->temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!this->mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/file";
              writeFile(small, contents);
              this->pointAt(small, this->backup);
              TypeParam editor;
              EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
              // Another file takes the space of the file, which has just been emptied.
              const BeforeCall written(Call::fwrite, [&] {
                std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              });

              EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(written.fired());
              EXPECT_LT(contentsOf(small).size(), contents.size() / 2);
              EXPECT_TRUE(editor.lists(TypeParam::kAlpha));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(this->backup), contents);
}

TYPED_TEST(LineFileTest, DeleteSucceedsWhenTheBackupCannotBeRemoved) {
  writeFile(this->path, this->alpha_line + this->beta_line);
  TypeParam editor;
  editor.read();
  const FailingCall removal(Call::remove, EBUSY);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  ASSERT_TRUE(removal.fired());
  EXPECT_EQ(contentsOf(this->path), this->beta_line);
  EXPECT_EQ(contentsOf(this->backup), this->alpha_line + this->beta_line);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kBeta));
}

// ---- Backup ----

TYPED_TEST(LineFileTest, NewBackupIsWholeAndHasMode0640WhileItExists) {
  writeFile(this->path, this->alpha_line + this->beta_line);
  TypeParam editor;
  editor.read();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(this->backup);
        mode = modeOf(this->backup);
      },
      3);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, this->alpha_line + this->beta_line);
  EXPECT_EQ(mode, 0640U);
  EXPECT_FALSE(pathExists(this->backup));
  EXPECT_EQ(umask(022), 026U) << "sic: stays set after a new backup";
}

TYPED_TEST(LineFileTest, ExistingBackupKeepsItsModeAndIsRemoved) {
  writeFile(this->path, this->alpha_line + this->beta_line);
  writeFile(this->backup, "an old copy, which is much longer than the file that replaces it\n");
  ASSERT_EQ(chmod(this->backup.c_str(), 0600), 0);
  TypeParam editor;
  editor.read();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(this->backup);
        mode = modeOf(this->backup);
      },
      4);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, this->alpha_line + this->beta_line);
  EXPECT_EQ(mode, 0600U);
  EXPECT_FALSE(pathExists(this->backup));
  EXPECT_EQ(umask(022), 022U) << "only a new backup sets it";
}

TYPED_TEST(LineFileTest, BackupIsMadeWhereItIsWantedAtTheTimeOfTheCall) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const std::string elsewhere = this->temp.path("elsewhere");
  TypeParam::fileBackup() = elsewhere.c_str();
  bool was_there = false;
  const BeforeCall opened(
      Call::fopen64, [&] { was_there = pathExists(elsewhere); }, 3);

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

  EXPECT_TRUE(was_there);
  EXPECT_FALSE(pathExists(elsewhere));
}

// A failed copy changes neither the file nor the list.
TYPED_TEST(LineFileTest, DeleteWithoutABackupChangesNothing) {
  const std::string contents = this->alpha_line + this->beta_line;
  writeFile(this->path, contents);
  const std::string directory = this->temp.dir("directory");
  const std::string below_nothing = this->temp.path("missing/backup");
  const std::string hard_link = this->temp.path("hard");
  ASSERT_EQ(link(this->path.c_str(), hard_link.c_str()), 0);
  const std::string soft_link = this->temp.path("soft");
  ASSERT_EQ(symlink(this->path.c_str(), soft_link.c_str()), 0);
  TypeParam editor;
  editor.read();
  const int descriptors = openDescriptors();

  for (const char* const place :
       {directory.c_str(), below_nothing.c_str(), this->path.c_str(), hard_link.c_str(),
        soft_link.c_str(), static_cast<const char*>(nullptr)}) {
    const std::string shown = place == nullptr ? "(null)" : place;
    SCOPED_TRACE(shown);
    TypeParam::fileBackup() = place;
    const Records records;

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(contentsOf(this->path), contents);
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
    EXPECT_EQ(openDescriptors(), descriptors);
    const Trail trail = records.trail();
    ASSERT_GE(trail.size(), 2U);
    EXPECT_EQ(trail[trail.size() - 2], "D " + TypeParam::copyFailed(this->path, shown));
    EXPECT_EQ(trail.back(), TypeParam::deleting(50).back());
  }
  EXPECT_TRUE(pathExists(hard_link));
  EXPECT_TRUE(pathExists(soft_link));
}

TYPED_TEST(LineFileTest, BackupMayHaveTheInodeNumberOfTheFile) {
  REQUIRE_ROOT("for two file systems");
  const std::string contents = this->alpha_line + this->beta_line;
  const std::string first = this->temp.dir("disk1") + "/file";
  const std::string second = this->temp.dir("disk2") + "/backup";
  constexpr int kOtherNumber = 77;
  const int result = withPrivateMounts([&] {
    for (const std::string& each : {first, second}) {
      const std::string disk = std::filesystem::path(each).parent_path();
      if (!this->mountSmallDisk(disk, kSmallDiskBytes)) return 1;
      writeFile(each, contents);
    }
    struct stat of_first;
    struct stat of_second;
    if (stat(first.c_str(), &of_first) != 0 || stat(second.c_str(), &of_second) != 0) return 1;
    if (of_first.st_ino != of_second.st_ino) return kOtherNumber;
    this->pointAt(first, second);
    TypeParam editor;
    editor.read();

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

    EXPECT_EQ(contentsOf(first), this->beta_line);
    EXPECT_FALSE(pathExists(second));
    return 0;
  });
  if (result == kOtherNumber) GTEST_SKIP() << "this tmpfs numbers files across mounts";
  EXPECT_EQ(result, 0);
}

TYPED_TEST(LineFileTest, DeleteTrustsNoBackupThatItCannotExamine) {
  const std::string contents = this->alpha_line + this->beta_line;
  writeFile(this->path, contents);
  TypeParam editor;
  editor.read();
  // The stat64 of the file after checkFilePerms, and the last one of the copy.
  for (const int nth : {3, 12}) {
    SCOPED_TRACE(nth);
    const FailingCall status(Call::stat64, EIO, nth);

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(status.fired());
    EXPECT_EQ(status.calls(), nth);
    EXPECT_EQ(contentsOf(this->path), contents);
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
  }
  EXPECT_EQ(contentsOf(this->backup), contents);
}

TYPED_TEST(LineFileTest, DeleteReportsTheFailedCopyAfterTheRecordsOfTheCopy) {
  writeFile(this->path, this->alpha_line);
  ASSERT_EQ(mkdir(this->backup.c_str(), 0755), 0);
  TypeParam editor;
  editor.read();
  const Records records;

  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::deleting(
                  50, TypeParam::kListed + kGoodFile +
                          call("copyFile", 0,
                               kCopySource + call("doesFileExist", 1) +
                                   call("canWriteToFile", 0, call("isDirectory", 1))) +
                          Trail{"D " + TypeParam::copyFailed(this->path, this->backup)})));
}

TYPED_TEST(LineFileTest, DeleteTouchesNothingWhenTheBackupDoesNotFitItsDisk) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = this->manyLines();
  writeFile(this->path, contents);
  const std::string disk = this->temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!this->mountSmallDisk(disk, 16 * 1024)) return 1;
              const std::string small = disk + "/backup";
              TypeParam::fileBackup() = small.c_str();
              TypeParam editor;
              EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
              const Records records;

              EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(editor.lists(TypeParam::kAlpha));
              EXPECT_THAT(records.texts(), Contains(TypeParam::copyFailed(this->path, small)));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(this->path), contents);
}

TYPED_TEST(LineFileTest, DeleteByAUserWhoMayNotReadTheOldBackupEmptiesTheFile) {
  REQUIRE_ROOT("to become another user");
  const std::string folder = this->temp.dir("folder");
  ASSERT_EQ(chmod(folder.c_str(), 0777), 0);
  this->path = folder + "/file";
  this->backup = folder + "/backup";
  writeFile(this->path, this->alpha_line + this->beta_line);
  ASSERT_EQ(chmod(this->path.c_str(), 0666), 0);
  writeFile(this->backup, "old");
  ASSERT_EQ(chmod(this->backup.c_str(), 0222), 0);
  this->pointAt(this->path, this->backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     TypeParam editor;
                     editor.read();
                     EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(this->path), "");
  EXPECT_FALSE(pathExists(this->backup));
}

// ---- Power failure ----

TYPED_TEST(LineFileTest, DeleteLosesNoLineWhereverThePowerFails) {
  const std::string contents =
      this->alpha_line + this->beta_line + "# a comment\n" + this->gamma_line;
  const std::string target = this->temp.dir("elsewhere") + "/target";
  const struct {
    const char* backup;
    bool is_link;
    bool is_there;
  } cases[] = {{"new", false, false},
               {"old", false, true},
               {"link to an old one", true, true},
               {"link to nothing", true, false}};
  for (const auto& with : cases) {
    SCOPED_TRACE(with.backup);
    writeFile(this->path, contents);
    const std::string& copy = with.is_link ? target : this->backup;
    if (with.is_link) {
      ASSERT_EQ(symlink(target.c_str(), this->backup.c_str()), 0);
    }
    std::map<std::string, std::string> files = {{this->path, contents}};
    if (with.is_there) {
      writeFile(copy,
                "an old copy, which is much longer than the file that replaces it, all of it\n");
      files[copy] = contentsOf(copy);
    }
    TypeParam editor;
    editor.read();
    const FileSteps steps;

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

    std::map<std::string, std::string> now = {{this->path, contentsOf(this->path)}};
    if (with.is_link) now[copy] = contentsOf(copy);  // only the link is removed
    EXPECT_EQ(
        lostLines(steps.all(), files, now, {this->beta_line, "# a comment\n", this->gamma_line}),
        "");
    unlink(target.c_str());
  }
}

TYPED_TEST(LineFileTest, DeleteLosesNoLineInAFolderThatMayNotBeRead) {
  REQUIRE_ROOT("to become another user");
  const std::string contents = this->alpha_line + this->beta_line;
  const std::string folder = this->temp.dir("folder");
  ASSERT_EQ(chmod(this->temp.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod(folder.c_str(), 0733), 0);
  this->path = folder + "/file";
  this->backup = folder + "/backup";
  writeFile(this->path, contents);
  ASSERT_EQ(chmod(this->path.c_str(), 0666), 0);
  this->pointAt(this->path, this->backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     TypeParam editor;
                     editor.read();
                     const FileSteps steps;
                     EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);
                     EXPECT_EQ(lostLines(steps.all(), {{this->path, contents}},
                                         {{this->path, this->beta_line}}, {this->beta_line}),
                               "");
                     return 0;
                   }),
            0);
}

TYPED_TEST(LineFileTest, DeleteChangesNothingWhenTheBackupCannotBeForcedToTheDisk) {
  const std::string contents = this->alpha_line + this->beta_line;
  const struct {
    const char* what;
    Call call;
    int nth;
    Call also;  // also fails
    int also_nth;
  } cases[] = {
      {"its contents", Call::fsync, 1, Call::syncfs, kNever},
      {"its name", Call::fsync, 2, Call::syncfs, kNever},
      {"its file system", Call::syncfs, 1, Call::open64, 3},  // the folder cannot be opened
      {"nothing of it", Call::open64, 2, Call::syncfs, kNever},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.what);
    writeFile(this->path, contents);
    TypeParam editor;
    editor.read();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);
    const FailingCall other_failure(with.also, EACCES, with.also_nth);

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(this->path), contents);
    EXPECT_FALSE(pathExists(this->backup));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::deleting(
                    50, TypeParam::kListed + kGoodFile + copiedToNewFile() + kDeleted +
                            Trail{"D " + TypeParam::copyFailed(this->path, this->backup)})));
  }
}

TYPED_TEST(LineFileTest, DeleteKeepsTheBackupWhenTheFileCannotBeForcedToTheDisk) {
  const std::string contents = this->alpha_line + this->beta_line;
  for (const Call call : {Call::fsync, Call::fflush}) {
    SCOPED_TRACE(static_cast<int>(call));
    writeFile(this->path, contents);
    TypeParam editor;
    editor.read();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(call, EIO, call == Call::fsync ? 3 : 1);

    EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(this->backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha, TypeParam::kBeta));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::deleting(
                    50, TypeParam::kListed + kGoodFile + copiedToNewFile() +
                            Trail{"D " + TypeParam::copyFailed(this->backup, this->path)})));
    ASSERT_EQ(unlink(this->backup.c_str()), 0);
  }
}

TYPED_TEST(LineFileTest, DeleteGoesOnWhereNothingCanBeForcedAndAfterASignal) {
  for (const int reason : {EINVAL, EINTR}) {
    for (const int nth : {1, 2, 3}) {
      SCOPED_TRACE(std::to_string(reason) + " " + std::to_string(nth));
      writeFile(this->path, this->alpha_line + this->beta_line);
      TypeParam editor;
      editor.read();
      const FailingCall failure(Call::fsync, reason, nth);

      EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);

      ASSERT_TRUE(failure.fired());
      EXPECT_EQ(failure.calls(), reason == EINTR ? 4 : 3);
      EXPECT_EQ(contentsOf(this->path), this->beta_line);
      EXPECT_FALSE(pathExists(this->backup));
    }
  }
}

// The name of the backup is forced through its directory, or through the file system if the path is too
// long for a small stack.
TYPED_TEST(LineFileTest, DeleteForcesTheBackupsNameWhateverItsPath) {
  const std::string folder = this->temp.path();
  std::string deep = folder;
  while (deep.size() < 1200)
    deep = this->temp.dir((deep.substr(folder.size()) + "/0123456789").substr(1));
  const struct {
    std::string path;
    std::string forced;  // empty: the whole file system
  } cases[] = {{"backup", folder},
               {"./backup", folder},
               {"/osutils-test-backup", "/"},
               {folder + std::string(1023 - folder.size(), '/') + "backup", folder},
               {folder + std::string(1024 - folder.size(), '/') + "backup", ""},
               {deep + "/backup", ""}};
  for (const auto& with : cases) {
    if (with.forced == "/" && access("/", W_OK) != 0) continue;
    SCOPED_TRACE(with.path);
    EXPECT_EQ(inChild([&] {
                EXPECT_EQ(chdir(folder.c_str()), 0);
                writeFile(this->path, this->alpha_line);
                this->pointAt(this->path, with.path);
                TypeParam editor;
                editor.read();
                const FileSteps steps;
                EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_SUCCESS);
                std::string forced = "nothing";
                for (const FileStep& step : steps.all()) {
                  if (step.kind == FileStep::kForcedAll) forced = "";
                  if (step.kind == FileStep::kForced && std::filesystem::is_directory(step.path)) {
                    forced = step.path;
                  }
                }
                EXPECT_EQ(forced, with.forced);
                EXPECT_FALSE(pathExists(with.path));
                return 0;
              }),
              0);
  }
}

// ---- Small stacks ----

TYPED_TEST(LineFileTest, KeepsToASmallStack) {
  REQUIRE_OWN_MALLOC();  // sanitizers also enlarge stack frames
  std::string lines = this->alpha_line;
  while (lines.size() < 40000) lines += this->beta_line;
  // First on a large stack: the loader resolves the functions.
  for (const bool small : {false, true}) {
    writeFile(this->path, lines);
    writeFile(this->backup, "an existing backup needs no account look-up");
    bool done = false;
    const auto edit = [&] {
      TypeParam file;
      done = file.read() == OSUTILS_SUCCESS && file.remove(TypeParam::kAlpha) == OSUTILS_SUCCESS;
    };
    if (small) {
      EXPECT_TRUE(keepsToASmallStack(edit));
    } else {
      edit();
    }
    EXPECT_TRUE(done);
    EXPECT_TRUE(contentsOf(this->path) == lines.substr(this->alpha_line.size()));
  }
}

// ---- Cancellation ----

// The thread is cancelled at each call of an edit in turn. The edit still completes, then the thread
// ends.
TYPED_TEST(LineFileTest, EditsAreFinishedByAThreadThatIsCancelled) {
  const std::string contents = this->alpha_line + this->beta_line;
  const struct {
    const char* what;
    std::function<int(TypeParam&)> edit;
    std::vector<Call> calls;
    std::string left;
    int blocks;  // that the list gains
  } cases[] = {
      {"load",
       [](TypeParam& editor) { return editor.read(); },
       {Call::stat64, Call::fopen64, Call::allocation, Call::fread, Call::fclose},
       contents,
       2},
      {"add",
       [](TypeParam& editor) { return editor.add(TypeParam::kGamma); },
       {Call::stat64, Call::allocation, Call::fopen64, Call::vra_asprintf, Call::fwrite,
        Call::fclose},
       contents + this->gamma_line,
       1},
      {"delete",
       [](TypeParam& editor) { return editor.remove(TypeParam::kAlpha); },
       {Call::stat64, Call::open64, Call::fchown, Call::close, Call::fopen64, Call::copy_file_range,
        Call::read, Call::fsync, Call::fread, Call::fwrite, Call::fflush, Call::fclose,
        Call::remove},
       this->beta_line,
       0},
  };
  for (const auto& with : cases) {
    for (const Call at : with.calls) {
      if (at == Call::allocation && sanitizerOwnsMalloc()) continue;
      SCOPED_TRACE(with.what + (" " + std::to_string(static_cast<int>(at))));
      EXPECT_EQ(inChild([&] {
                  for (int nth = 1;; ++nth) {
                    SCOPED_TRACE(nth);
                    writeFile(this->path, contents);
                    TypeParam editor;
                    if (with.blocks != 2) editor.read();
                    const int descriptors = openDescriptors();
                    int answer = -1;
                    const CancelledCall call =
                        cancelledAt(at, nth, [&] { answer = with.edit(editor); });
                    EXPECT_TRUE(call.returned);
                    EXPECT_EQ(answer, OSUTILS_SUCCESS);
                    EXPECT_EQ(call.ended, call.asked);
                    EXPECT_EQ(contentsOf(this->path), with.left);
                    EXPECT_FALSE(pathExists(this->backup));
                    EXPECT_EQ(openDescriptors(), descriptors);
                    EXPECT_EQ(call.blocks, sanitizerOwnsMalloc() ? 0 : with.blocks);
                    if (!call.asked || testing::Test::HasFailure()) return nth == 1 ? 1 : 0;
                  }
                }),
                0);
    }
  }
}

}  // namespace
