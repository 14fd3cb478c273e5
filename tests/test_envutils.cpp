#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>

#include "faults.h"
#include "ldtr.h"
#include "osutils.h"
#include "owned.h"
#include "records.h"

// The C library allocates the assignments that putEnvVar leaks deliberately. It has no frame
// pointers, so the fast unwinder does not find putEnvVar, which the suppressions name.
extern "C" __attribute__((visibility("default"))) const char* __asan_default_options() {
  return "fast_unwind_on_malloc=0";
}

namespace {

using osutils::OwnedString;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr char kName[] = "OSUTILS_TEST_VARIABLE";

// Unsets the variable before and after each test.
class Environment : public testing::Test {
 protected:
  Environment() { unsetenv(kName); }
  ~Environment() override { unsetenv(kName); }

  std::string name_ = kName;
};

using GetEnvVar = Environment;
using PutEnvVar = Environment;

TEST_F(GetEnvVar, GivesACopyOfTheValue) {
  setenv(kName, "some value", 1);
  const Records records;

  const OwnedString value(getEnvVar(kName));

  EXPECT_STREQ(value.get(), "some value");
  EXPECT_NE(value.get(), getenv(kName));
  EXPECT_THAT(records.trail(), ElementsAre("> getEnvVar", "< getEnvVar 0"));
}

TEST_F(GetEnvVar, GivesAFreshCopyEachTimeAndFreeingItLeavesTheEnvironmentAlone) {
  std::string value = "1";
  ASSERT_EQ(putEnvVar(name_.data(), value.c_str()), OSUTILS_SUCCESS);
  const LiveAllocations live;

  OwnedString first(getEnvVar(kName));
  const OwnedString second(getEnvVar(kName));

  EXPECT_NE(first.get(), second.get());
  EXPECT_STREQ(first.get(), "1");
  first.get()[0] = 'x';
  first.reset();
  EXPECT_STREQ(second.get(), "1");
  EXPECT_STREQ(getenv(kName), "1");
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 1);
  }
}

TEST_F(GetEnvVar, OfAnEmptyVariableIsTheEmptyString) {
  setenv(kName, "", 1);

  const OwnedString value(getEnvVar(kName));

  EXPECT_STREQ(value.get(), "");
}

TEST_F(GetEnvVar, OfAnUnsetVariableIsNullWithoutAMessage) {
  const Records records;

  EXPECT_EQ(getEnvVar(kName), nullptr);

  EXPECT_THAT(records.trail(), ElementsAre("> getEnvVar", "< getEnvVar 0"));
}

TEST_F(GetEnvVar, PassesTheAnswerOfThePlatformOnAndAsksItOnce) {
  setenv(kName, "set", 1);
  const FailingCall platform(Call::ldap_getenv, ENOMEM);
  const Records records;

  EXPECT_EQ(getEnvVar(kName), nullptr);

  EXPECT_EQ(platform.calls(), 1);
  EXPECT_THAT(records.trail(), ElementsAre("> getEnvVar", "< getEnvVar 0"));
}

TEST_F(GetEnvVar, OfANullNameSaysSoAndAsksNobody) {
  const FailingCall platform(Call::ldap_getenv, ENOMEM);
  const Records records;

  EXPECT_EQ(getEnvVar(nullptr), nullptr);

  EXPECT_EQ(platform.calls(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> getEnvVar", "D getEnvVar: passed a null pointer.\n", "< getEnvVar 0"));
}

TEST_F(GetEnvVar, CarriesTheSecondErrorBitWithoutEverUsingIt) {
  const Records records(kExitError33);

  EXPECT_EQ(getEnvVar(nullptr), nullptr);

  EXPECT_THAT(records.trail(), ElementsAre("< getEnvVar 0"));
}

TEST_F(PutEnvVar, SetsTheVariable) {
  const Records records;

  EXPECT_EQ(putEnvVar(name_.data(), "a=b c"), OSUTILS_SUCCESS);

  EXPECT_STREQ(getenv(kName), "a=b c");
  EXPECT_THAT(records.trail(), ElementsAre("> putEnvVar", "< putEnvVar 0"));
}

TEST_F(PutEnvVar, ReplacesAnEarlierValue) {
  ASSERT_EQ(putEnvVar(name_.data(), "old"), OSUTILS_SUCCESS);

  EXPECT_EQ(putEnvVar(name_.data(), "new"), OSUTILS_SUCCESS);

  EXPECT_STREQ(getenv(kName), "new");
}

TEST_F(PutEnvVar, AcceptsTheEmptyString) {
  EXPECT_EQ(putEnvVar(name_.data(), ""), OSUTILS_SUCCESS);

  EXPECT_STREQ(getenv(kName), "");
}

TEST_F(PutEnvVar, TakesPercentSignsAsTheyStand) {
  EXPECT_EQ(putEnvVar(name_.data(), "100%s%n%%"), OSUTILS_SUCCESS);

  EXPECT_STREQ(getenv(kName), "100%s%n%%");
}

TEST_F(PutEnvVar, TakesALongValueWhole) {
  const std::string value(100'000, 'v');

  EXPECT_EQ(putEnvVar(name_.data(), value.c_str()), OSUTILS_SUCCESS);

  EXPECT_EQ(getenv(kName), value);
}

TEST_F(PutEnvVar, TheEnvironmentKeepsTheVeryBuffer) {
  const LiveAllocations live;

  ASSERT_EQ(putEnvVar(name_.data(), "kept"), OSUTILS_SUCCESS);

  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 1);
  }
  // The platform made no copy: the value is the end of one block "name=value".
  const char* const value = getenv(kName);
  ASSERT_NE(value, nullptr);
  EXPECT_EQ(std::string(value - name_.size() - 1), name_ + "=kept");
}

TEST_F(PutEnvVar, OfANullNameGivesTheGettersText) {
  const FailingCall platform(Call::ldap_putenv, 1);
  const Records records;

  EXPECT_EQ(putEnvVar(nullptr, "v"), OSUTILS_PARAM_ERROR);

  EXPECT_EQ(platform.calls(), 0);
  EXPECT_THAT(records.trail(), ElementsAre("> putEnvVar", "D getEnvVar: passed a null pointer.\n",
                                           "<! putEnvVar 89"));
}

TEST_F(PutEnvVar, OfANullValueGivesTheGettersText) {
  const Records records;

  EXPECT_EQ(putEnvVar(name_.data(), nullptr), OSUTILS_PARAM_ERROR);

  EXPECT_EQ(getenv(kName), nullptr);
  EXPECT_THAT(records.trail(), ElementsAre("> putEnvVar", "D getEnvVar: passed a null pointer.\n",
                                           "<! putEnvVar 89"));
}

TEST_F(PutEnvVar, OfTwoNullsSaysItOnce) {
  const Records records;

  EXPECT_EQ(putEnvVar(nullptr, nullptr), OSUTILS_PARAM_ERROR);

  EXPECT_THAT(records.texts(), ElementsAre("getEnvVar: passed a null pointer.\n"));
}

TEST_F(PutEnvVar, WithoutMemoryForTheAssignmentChangesNothing) {
  setenv(kName, "old", 1);
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const FailingCall platform(Call::ldap_putenv, 1);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(putEnvVar(name_.data(), "new"), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(platform.calls(), 0);
  EXPECT_STREQ(getenv(kName), "old");
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> putEnvVar", "D putEnvVar: vra_asprintf failed\n", "<! putEnvVar 90"));
}

TEST_F(PutEnvVar, RefusedByThePlatformLeavesTheAssignmentAllocated) {
  for (const int rc : {1, -1, 12}) {
    SCOPED_TRACE(rc);
    const FailingCall refusal(Call::ldap_putenv, rc);
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(putEnvVar(name_.data(), "v"), OSUTILS_OPERATIONS_ERROR);

    ASSERT_TRUE(refusal.fired());
    EXPECT_EQ(getenv(kName), nullptr);
    if (!sanitizerOwnsMalloc()) {
      EXPECT_EQ(live.blocks(), 1);
    }
    EXPECT_THAT(
        records.trail(),
        ElementsAre("> putEnvVar", "D putEnvVar: putenv retured rc=" + std::to_string(rc) + ".\n",
                    "<! putEnvVar 1"));
  }
}

TEST_F(PutEnvVar, WritesNoMessageWhileDebugIsOff) {
  const Records records(kEntryExit33 | kExitError33);

  EXPECT_EQ(putEnvVar(nullptr, "v"), OSUTILS_PARAM_ERROR);

  EXPECT_THAT(records.all(), testing::SizeIs(2));
  EXPECT_THAT(records.prints(), IsEmpty());
  EXPECT_EQ(records.exitCode(), OSUTILS_PARAM_ERROR);
}

TEST_F(PutEnvVar, AnswersTheSameWithTracingOff) {
  const Records records(0);

  EXPECT_EQ(putEnvVar(nullptr, "v"), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(putEnvVar(name_.data(), "v"), OSUTILS_SUCCESS);
  const OwnedString value(getEnvVar(kName));

  EXPECT_STREQ(value.get(), "v");
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(EnvironmentIds, AreThoseOfTheModule) {
  const Records records;

  EXPECT_EQ(getEnvVar(nullptr), nullptr);
  EXPECT_EQ(putEnvVar(nullptr, nullptr), OSUTILS_PARAM_ERROR);

  const auto all = records.all();
  ASSERT_EQ(all.size(), 6U);
  for (size_t at = 0; at < all.size(); ++at) {
    EXPECT_EQ(all[at].id, at < 3 ? 0x3E040100U : 0x3E040200U) << at;
  }
}

}  // namespace
