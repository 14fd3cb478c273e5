// Construction, destruction, loading and adding, where both editors do the same.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <string>

#include "editors.h"
#include "faults.h"
#include "records.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

namespace {

template <typename Editor>
class EditorsTest : public EditorTest<Editor> {};
TYPED_TEST_SUITE(EditorsTest, BothEditors, );  // clang warns about fewer arguments

// ---- Construction and destruction ----

TYPED_TEST(EditorsTest, ConstructorReadsNoFile) {
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall queries(Call::stat64, 0, kNever);
  const Records records;

  const TypeParam editor;

  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_EQ(opens.calls() + queries.calls(), 0);
  EXPECT_THAT(records.trail(), ElementsAreArray(TypeParam::member(TypeParam::kClass, 0)));
}

TYPED_TEST(EditorsTest, PathIsTheOneThatWasSetAtConstruction) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  const std::string other = this->temp.file("other", this->beta_line);
  TypeParam::file() = other.c_str();

  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
}

TYPED_TEST(EditorsTest, DestructorFreesThePathAndTheList) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path, this->alpha_line + this->beta_line);
  const LiveAllocations memory;
  {
    TypeParam editor;
    EXPECT_EQ(memory.blocks(), 1);
    editor.read();
    EXPECT_EQ(editor.add(TypeParam::kGamma), OSUTILS_SUCCESS);
    EXPECT_EQ(memory.blocks(), 4);
  }
  EXPECT_EQ(memory.blocks(), 0);
}

TYPED_TEST(EditorsTest, DestructorLeavesRecords) {
  std::optional<TypeParam> editor(std::in_place);
  const Records records;

  editor.reset();

  EXPECT_THAT(records.trail(), ElementsAreArray(TypeParam::member(
                                   std::string("~") + TypeParam::kClass, 0, TypeParam::kFreed)));
}

TYPED_TEST(EditorsTest, WithoutItsPathEveryFileOperationIsAParameterError) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path, this->alpha_line);
  FailingCall copy(Call::strdup, ENOMEM);
  TypeParam editor;
  ASSERT_TRUE(copy.fired());
  const Trail refused =
      call("checkFilePerms", 89, Trail{"D checkFilePerms: passed a null pointer.\n"});

  {
    const Records records;
    EXPECT_EQ(editor.read(), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::reading(89, TypeParam::kFreed + refused)));
  }
  {
    const Records records;
    EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(TypeParam::adding(89, TypeParam::kAddable + refused)));
  }
  EXPECT_EQ(editor.remove(TypeParam::kAlpha), OSUTILS_NO_SUCH_OBJECT) << "the list is empty";
  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_EQ(contentsOf(this->path), this->alpha_line);
}

TYPED_TEST(EditorsTest, FreeingEmptiesTheListAndMayBeRepeated) {
  writeFile(this->path, this->alpha_line + this->beta_line);
  TypeParam editor;
  editor.read();

  editor.freeEntries();
  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_FALSE(editor.lists(TypeParam::kAlpha));
  editor.freeEntries();
  EXPECT_THAT(listOf(editor), IsEmpty());
}

// ---- Loading ----

TYPED_TEST(EditorsTest, LoadsWithTheRecordsOfEachStep) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  const Records records;

  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);

  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::reading(0, TypeParam::kFreed + kGoodFile)));
}

TYPED_TEST(EditorsTest, LoadingAgainReplacesTheList) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  writeFile(this->path, this->beta_line);

  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kBeta));
}

TYPED_TEST(EditorsTest, LoadsThroughALinkAndNothingThroughADanglingOne) {
  const std::string target = this->temp.file("target", this->alpha_line);
  ASSERT_EQ(symlink(target.c_str(), this->path.c_str()), 0);
  TypeParam editor;
  EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));

  ASSERT_EQ(unlink(target.c_str()), 0);
  EXPECT_EQ(editor.read(), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_FALSE(pathExists(target));
}

TYPED_TEST(EditorsTest, LoadingFromAMissingFileEmptiesTheList) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  ASSERT_EQ(unlink(this->path.c_str()), 0);
  const Records records;

  EXPECT_EQ(editor.read(), OSUTILS_NO_SUCH_OBJECT);

  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(TypeParam::reading(
          32, TypeParam::kFreed + call("checkFilePerms", 32,
                                       missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                                           Trail{"D checkFilePerms - The file " + this->path +
                                                 " does not exist.\n"}))));
}

TYPED_TEST(EditorsTest, DirectoryIsNotAFileToEdit) {
  ASSERT_EQ(mkdir(this->path.c_str(), 0755), 0);
  TypeParam editor;

  EXPECT_EQ(editor.read(), OSUTILS_CONSTRAINT_VIOLATION);
  EXPECT_EQ(editor.add(TypeParam::kAlpha), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_TRUE(std::filesystem::is_directory(this->path));
}

TYPED_TEST(EditorsTest, FileThatCannotBeOpenedForReading) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const int descriptors = openDescriptors();
  const Records records;
  const FailingCall open(Call::fopen64, EMFILE);

  EXPECT_EQ(editor.read(), OSUTILS_UNWILLING_TO_PERFORM);

  ASSERT_TRUE(open.fired());
  EXPECT_THAT(listOf(editor), IsEmpty());
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(), ElementsAreArray(TypeParam::reading(
                                   53, TypeParam::kFreed + kGoodFile +
                                           Trail{"D " + TypeParam::readOpenFailed(EMFILE)})));
}

TYPED_TEST(EditorsTest, PermissionsAreThoseOfTheUser) {
  REQUIRE_ROOT("to become another user");
  writeFile(this->path, this->alpha_line);
  ASSERT_EQ(chmod(this->path.c_str(), 0600), 0);
  const std::string closed = this->temp.dir("closed");
  const std::string hidden = this->temp.file("closed/file", this->alpha_line);
  ASSERT_EQ(chmod(closed.c_str(), 0700), 0);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     TypeParam unreadable;
                     const Records records;
                     EXPECT_EQ(unreadable.read(), OSUTILS_UNWILLING_TO_PERFORM);
                     EXPECT_THAT(records.texts(), ElementsAre(TypeParam::readOpenFailed(EACCES)));
                     EXPECT_EQ(unreadable.add(TypeParam::kBeta), OSUTILS_INSUFFICIENT_ACCESS);

                     this->pointAt(hidden, this->backup);
                     TypeParam invisible;
                     EXPECT_EQ(invisible.read(), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_EQ(invisible.add(TypeParam::kBeta), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(this->path), this->alpha_line);
  EXPECT_EQ(contentsOf(hidden), this->alpha_line);
}

TYPED_TEST(EditorsTest, LoadingIsAllOrNothingWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path,
            this->alpha_line + TypeParam::kIncompleteLine + this->beta_line + this->gamma_line);
  TypeParam editor;
  const int descriptors = openDescriptors();
  int nth = 1;
  for (;; ++nth) {
    SCOPED_TRACE(nth);
    editor.freeEntries();
    const LiveAllocations memory;
    FailingCall allocation(Call::allocation, ENOMEM, nth);
    const int rc = editor.read();
    allocation.disarm();
    EXPECT_EQ(openDescriptors(), descriptors);
    if (!allocation.fired()) {
      EXPECT_EQ(rc, OSUTILS_SUCCESS);
      EXPECT_EQ(memory.blocks(), 3) << "the incomplete line leaves no record behind";
      break;
    }
    EXPECT_EQ(rc, OSUTILS_NO_MEMORY);
    EXPECT_THAT(listOf(editor), IsEmpty());
    EXPECT_EQ(memory.blocks(), 0);
  }
  EXPECT_EQ(nth, 1 + 3 + TypeParam::kRecordsOfIncompleteLine);
}

TYPED_TEST(EditorsTest, ClosesTheFileAndFreesTheListBeforeItReportsThatMemoryRanOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path, this->alpha_line + this->beta_line);
  TypeParam editor;
  const Records records;
  size_t records_before_close = 0;
  const BeforeCall close(Call::fclose, [&] { records_before_close = records.trail().size(); });
  const FailingCall allocation(Call::allocation, ENOMEM, 2);

  EXPECT_EQ(editor.read(), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  ASSERT_TRUE(close.fired());
  EXPECT_EQ(records_before_close, (Trail{"> entry"} + TypeParam::kFreed + kGoodFile).size());
  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::reading(
                  90, TypeParam::kFreed + kGoodFile + TypeParam::kFreed +
                          Trail{"D " + std::string(TypeParam::kReadWithoutMemory)})));
}

// ---- Adding ----

TYPED_TEST(EditorsTest, AddsALineAtTheEndAndARecordAtTheHead) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const Records records;

  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(this->path), this->alpha_line + this->beta_line);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::adding(0, TypeParam::kAddable + kGoodFile)));
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kBeta, TypeParam::kAlpha));
  EXPECT_EQ(editor.add(TypeParam::kGamma), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(this->path), this->alpha_line + this->beta_line + this->gamma_line);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kGamma, TypeParam::kBeta, TypeParam::kAlpha));
}

TYPED_TEST(EditorsTest, AddsToAnUnfinishedLastLineAsItStands) {
  const std::string unfinished = this->alpha_line.substr(0, this->alpha_line.size() - 1);
  writeFile(this->path, unfinished);
  TypeParam editor;
  editor.read();

  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(this->path), unfinished + this->beta_line);
}

TYPED_TEST(EditorsTest, AddWithoutMemoryForTheRecordChangesNothing) {
  REQUIRE_OWN_MALLOC();
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const Records records;
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall allocation(Call::allocation, ENOMEM);

  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(opens.calls(), 0);
  EXPECT_EQ(contentsOf(this->path), this->alpha_line);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
  EXPECT_THAT(records.trail(),
              ElementsAreArray(TypeParam::adding(
                  90, TypeParam::kAddable + kGoodFile +
                          Trail{"D " + std::string(TypeParam::kAddWithoutMemory)})));
}

TYPED_TEST(EditorsTest, AddToAFileThatCannotBeOpenedChangesNothing) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall open(Call::fopen64, EROFS);

  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_INSUFFICIENT_ACCESS);

  ASSERT_TRUE(open.fired());
  EXPECT_EQ(contentsOf(this->path), this->alpha_line);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(), ElementsAreArray(TypeParam::adding(
                                   50, TypeParam::kAddable + kGoodFile +
                                           Trail{"D " + TypeParam::addOpenFailed(EROFS)})));
}

TYPED_TEST(EditorsTest, AddWithoutItsLineChangesNothing) {
  writeFile(this->path, this->alpha_line);
  TypeParam editor;
  editor.read();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall closes(Call::fclose, 0, kNever);
  const FailingCall print(Call::vra_asprintf, ENOMEM);

  EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(closes.calls(), 1);
  EXPECT_EQ(contentsOf(this->path), this->alpha_line);
  EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kAlpha));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(), ElementsAreArray(TypeParam::adding(
                                   90, TypeParam::kAddable + kGoodFile +
                                           Trail{"D " + std::string(TypeParam::kAddWithoutLine)})));
}

TYPED_TEST(EditorsTest, AddDoesNotLookAtTheResultsOfWritingAndClosing) {
  for (const Call failing : {Call::fwrite, Call::fclose}) {
    writeFile(this->path, this->alpha_line);
    TypeParam editor;
    editor.read();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const FailingCall failure(failing, ENOSPC);

    EXPECT_EQ(editor.add(TypeParam::kBeta), OSUTILS_SUCCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(this->path),
              failing == Call::fwrite ? this->alpha_line : this->alpha_line + this->beta_line);
    EXPECT_THAT(listOf(editor), ElementsAre(TypeParam::kBeta, TypeParam::kAlpha));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1) << "the record";
  }
}

}  // namespace
