#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "platform.h"
#include "records.h"
#include "test_ldtr.h"
#include "trace_scope.h"

using testing::ElementsAre;
using testing::Field;
using testing::IsEmpty;

namespace {

constexpr int kErrno = 77;
const int another_object = 0;

// ---- ldtr_write ----

TEST(Write, WithoutFormatHasNoData) {
  const Records records(0);  // ldtr_write() does not test the mask
  ldtr_write(kType, kId, &an_object);
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, &an_object, ""),
                                                        Field(&Record::hasData, false))));
}

TEST(Write, PassesAllSixtyFourBitsOn) {
  const Records records(0);
  ldtr_write(0xFEDCBA9876543210, 0x0123456789ABCDEF, nullptr);
  EXPECT_THAT(records.all(),
              ElementsAre(isRecord(0xFEDCBA9876543210, 0x0123456789ABCDEF, nullptr, "")));
}

TEST(Write, RecordsTheTextWithoutItsNul) {
  const Records records(0);
  writeText(kType, kId, &an_object, "%s=%d\n", "answer", 42);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "answer=42\n")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(Write, RecordsAnEmptyTextAsDataOfNoLength) {
  const Records records(0);
  writeText(kType, kId, nullptr, "");
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, nullptr, ""),
                                                        Field(&Record::hasData, true))));
}

TEST(Write, EndsTheDataAtANulInTheText) {
  const Records records(0);
  writeText(kType, kId, nullptr, "before%cafter", '\0');
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, "before")));
}

std::string formatError(int rc) {
  return "Error - ldtr_write: Debug format error - buffer is 8192 bytes rc=" + std::to_string(rc) +
         "\n";
}

TEST(Write, ReplacesATextOfMoreThan8192Characters) {
  const std::pair<int, std::string> cases[] = {
      {8190, std::string(8190, 'x')}, {8191, std::string(8191, 'x')},
      {8192, std::string(8191, 'x')},  // accepted, but the buffer has room for one character less
      {8193, formatError(8193)},      {1'000'000, formatError(1'000'000)},
  };
  for (const auto& [length, data] : cases) {
    SCOPED_TRACE(length);
    const Records records(0);
    writeText(kType, kId, &an_object, "%s", std::string(static_cast<size_t>(length), 'x').c_str());
    EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, data)));
  }
}

TEST(Write, ReplacesATextThatCannotBeFormatted) {
  const Records records(0);
  writeText(kType, kId, nullptr, "%ls", kUnprintable);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, formatError(-1))));
}

TEST(Write, ReplacesATextThatThePlatformRefusesToFormat) {
  const Records records(0);
  const FailingCall format(Call::vra_vsnprintf, EIO);
  writeText(kType, kId, nullptr, "%s", "fine");
  ASSERT_TRUE(format.fired());
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, formatError(-1))));
}

TEST(Write, WithoutMemoryLeavesTheRecordOut) {
  REQUIRE_OWN_MALLOC();
  const Records records(0);
  const FailingCall memory(Call::calloc, ENOMEM);
  const FailingCall format(Call::vra_vsnprintf, EIO, 1000);
  writeText(kType, kId, nullptr, "%s", "lost");
  ASSERT_TRUE(memory.fired());
  EXPECT_EQ(format.calls(), 0);
  EXPECT_THAT(records.all(), IsEmpty());
}

TEST(Write, AllocatesOneBufferAndFreesIt) {
  REQUIRE_OWN_MALLOC();
  const Records records(0);
  const FailingCall allocations(Call::allocation, ENOMEM, 1000);
  const LiveAllocations live;
  writeText(kType, kId, nullptr, "%s", "text");
  writeText(kType, kId, nullptr, "%s", std::string(9000, 'x').c_str());
  EXPECT_EQ(allocations.calls(), 2);
  EXPECT_EQ(live.blocks(), 0);
}

// ---- Formatters ----

TEST(LocalFormatter, WritesARecordWithoutData) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object)();
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, &an_object, ""),
                                                        Field(&Record::hasData, false))));
}

TEST(LocalFormatter, WritesTheText) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object)("%d-%s", 1, "a");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "1-a")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(LocalFormatter, PutsTheLowByteOfTheSubNumberIntoTheId) {
  const Records records;
  ldtr_formater_local formatter(kId | 0x01, kType, &an_object);
  formatter(0xABCD34UL, "%d-%s", 2, "b");
  formatter(0xFF00UL, "%d-%s", 3, "c");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId | 0x35, &an_object, "2-b"),
                                         isRecord(kType, kId | 0x01, &an_object, "3-c")));
}

TEST(LocalFormatter, NewDeleteIsAboutTheGivenPointer) {
  const Records records;
  ldtr_formater_local formatter(kId, kType, &an_object);
  formatter.new_delete(&another_object, "%d-%s", 4, "d");
  formatter.new_delete(0x1142UL, &another_object, "%d-%s", 5, "e");
  formatter.new_delete(static_cast<const void*>(nullptr), "%d", 6);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &another_object, "4-d"),
                                         isRecord(kType, kId | 0x42, &another_object, "5-e"),
                                         isRecord(kType, kId, nullptr, "6")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(LocalFormatter, DebugAddsTheLowByteOfTheLevelAndPrints) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object).debug(0xC8010000, "%d-%s\n", 7, "f");
  ldtr_formater_local(kId, kType, &an_object).debug(0xC8010042, "%d-%s\n", 8, "g");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "7-f\n"),
                                         isRecord(kType, kId | 0x42, &an_object, "8-g\n")));
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8010000, "7-f\n"), isPrint(0xC8010042, "8-g\n")));
}

TEST(LocalFormatter, DebugAtTheErrorLevelChangesTheTypeForGood) {
  const Records records;
  ldtr_formater_local formatter(kId, 0x5123456, &an_object);
  formatter.debug(0xC8110001, "near\n");
  formatter.debug(0xC8110000, "error\n");
  formatter.debug(0xC8010000, "after\n");
  formatter();
  EXPECT_THAT(records.all(), ElementsAre(isRecord(0x5123456, kId | 1, &an_object, "near\n"),
                                         isRecord(0x5070000, kId, &an_object, "error\n"),
                                         isRecord(0x5070000, kId, &an_object, "after\n"),
                                         isRecord(0x5070000, kId, &an_object, "")));
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8110001, "near\n"), isPrint(0xC8110000, "error\n"),
                          isPrint(0xC8010000, "after\n")));
}

TEST(GlobalFormatter, WritesTheTextUnderTheGivenId) {
  const Records records;
  ldtr_formater_global formatter(kType);
  formatter(0x123456789AUL, "%d-%s", 1, "a");
  formatter.new_delete(0x1142UL, &another_object, "%d-%s", 2, "b");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, 0x123456789A, nullptr, "1-a"),
                                         isRecord(kType, 0x1142, &another_object, "2-b")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(GlobalFormatter, DebugTakesTheWholeLevelAsTheId) {
  const Records records;
  ldtr_fun(kType).debug(0xC8010042, "%d-%s\n", 3, "c");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, 0xC8010042, nullptr, "3-c\n")));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8010042, "3-c\n")));
}

TEST(GlobalFormatter, DebugAtTheErrorLevelChangesTheTypeForGood) {
  const Records records;
  ldtr_formater_global formatter(kType);
  formatter.debug(0xC8110000, "error\n");
  formatter(5UL, "after");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(0x3070000, 0xC8110000, nullptr, "error\n"),
                                         isRecord(0x3070000, 5, nullptr, "after")));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8110000, "error\n")));
}

TEST(Debug, WritesTheRecordBeforeThePrint) {
  const Records records;
  {
    osutils::TraceScope<osutils::traced::isFile> trace;
    trace(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ORDINARY, "scoped\n");
    ldtr_fun(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ERROR, "unscoped message\n");
  }
  // A print that does not directly follow its record would add a line with a question mark.
  EXPECT_THAT(records.trail(),
              ElementsAre("> isFile", "D scoped\n", "E unscoped message\n", "< isFile 0"));
}

TEST(Debug, PrintsWithoutARecordWhenThereIsNoMemoryForIt) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  FailingCall memory(Call::calloc, ENOMEM, 1, 2);
  ldtr_formater_local(kId, kType, nullptr).debug(0xC8010000, "local %d\n", 1);
  ldtr_formater_global(kType).debug(0xC8110000, "global %d\n", 2);
  memory.disarm();
  ASSERT_EQ(memory.calls(), 2);
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8010000, "local 1\n"), isPrint(0xC8110000, "global 2\n")));
}

TEST(Debug, PrintsTheWholeTextWhoseRecordWasReplaced) {
  const std::string text(10'000, 'x');
  const Records records;
  ldtr_fun(kType).debug(0xC8010000, "%s", text.c_str());
  EXPECT_THAT(records.texts(), ElementsAre(formatError(10'000)));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8010000, text)));
}

TEST(Errno, IsTheSameAfterEveryOperation) {
  const Records records;
  ldtr_formater_local local(kId, kType, nullptr);
  ldtr_formater_global global(kType);
  const std::function<void()> operations[] = {
      [&] { ldtr_write(kType, kId, nullptr); },
      [&] { writeText(kType, kId, nullptr, "%d", 1); },
      [&] { ldtr_exit_errcode(kId, 33, 0x1000, 1, nullptr); },
      [&] { local(); },
      [&] { local("%d", 1); },
      [&] { local(1UL, "%d", 1); },
      [&] { local.new_delete(&an_object, "%d", 1); },
      [&] { local.new_delete(1UL, &an_object, "%d", 1); },
      [&] { local.debug(LDTR_LEVEL_ORDINARY, "%d", 1); },
      [&] { global(1UL, "%d", 1); },
      [&] { global.new_delete(1UL, &an_object, "%d", 1); },
      [&] { global.debug(LDTR_LEVEL_ERROR, "%d", 1); },
      [&] { const Scope33 scope(nullptr); },
      [&] { const osutils::TraceScope<osutils::traced::isFile> trace; },
  };
  int number = 0;
  for (const auto& operation : operations) {
    SCOPED_TRACE(number++);
    const size_t before = records.all().size();
    errno = kErrno;
    operation();
    const int after = errno;
    EXPECT_EQ(after, kErrno);
    EXPECT_GT(records.all().size(), before);
  }
}

TEST(Errno, IsTheSameAfterARecordThatWasLeftOut) {
  REQUIRE_OWN_MALLOC();
  const FailingCall memory(Call::calloc, ENOMEM);
  errno = kErrno;
  writeText(kType, kId, nullptr, "%d", 1);
  const int after = errno;
  ASSERT_TRUE(memory.fired());
  EXPECT_EQ(after, kErrno);
}

TEST(Errno, IsTheCallersInEachRecordAndPrint) {
  static std::vector<int> seen;
  seen.clear();
  atTracing = [] { seen.push_back(errno); };
  const Records records;
  errno = kErrno;
  ldtr_formater_local(kId, kType, nullptr).debug(LDTR_LEVEL_ORDINARY, "local");
  ldtr_formater_global(kType).debug(LDTR_LEVEL_ORDINARY, "global");
  atTracing = nullptr;
  EXPECT_THAT(seen, ElementsAre(kErrno, kErrno, kErrno, kErrno));
}

const std::vector<uintptr_t> kCodeAtStart = words<1>(ldtr_fun);

TEST(GlobalScope, BeginsWithTheCodeZero) { EXPECT_THAT(kCodeAtStart, ElementsAre(0U)); }

TEST(GlobalScope, StoresEveryCodeIntoTheOneObject) {
  ldtr_function_global other;
  EXPECT_EQ(ldtr_fun.SetErrorCode(5), 5);
  EXPECT_THAT(words<1>(ldtr_fun), ElementsAre(5U));
  EXPECT_EQ(other.SetErrorCode(-7), -7);
  EXPECT_THAT(words<1>(ldtr_fun), ElementsAre(static_cast<uintptr_t>(-7L)));
  EXPECT_THAT(words<1>(other), ElementsAre(0U));
  EXPECT_EQ(ldtr_fun.SetErrorCode(0), 0);
}

TEST(Init, GivesTheAnswerOfTheTraceLibrary) {
  for (const int answer : {0, 7, -1}) {
    const int calls = trcInitCalls;
    trcInitAnswer = answer;
    EXPECT_EQ(ldtr_init(), answer);
    EXPECT_EQ(trcInitCalls, calls + 1);
  }
  trcInitAnswer = 0;
}

}  // namespace
