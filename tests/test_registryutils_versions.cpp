#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "osutils.h"
#include "records.h"
#include "test_registryutils.h"
#include "trails.h"

using testing::IsEmpty;

namespace {

TEST(IsVersionValid, TakesOneToFourGroupsOfDigits) {
  for (const char* const version :
       {"0", "9", "42", "9.1", "9.1.0", "9.1.0.2", "00.00.00.00", "10.11.12.13", "1234567890",
        "99999999999999999999.1.0.123456789012345678901234567890"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_TRUE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, true));
  }
}

TEST(IsVersionValid, RefusesEverythingElse) {
  for (const char* const version :
       {"",       ".",        "..",        ".9",          "9.",          "9..1", "9...1",
        "9.1..2", "9.1.0..2", "9.1.0.2.3", "9.1.0.2.3.4", "1.2.3.4.x.5", "9.1a", "a9.1",
        "9a1",    "9.a.1",    "V9",        "a",           " 9.1",        "9.1 ", "9. 1",
        "9 1",    "9.1\r",    "9.1\n",     "9.1\t",       "9\0011",      "-9",   "+9",
        "9-1",    "9,1",      "9/1",       "9:1",         "0x9",         "9%s1", "%n"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_FALSE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, false));
  }
}

TEST(IsVersionValid, KnowsNoDigitsButTheTenOfAscii) {
  for (const char* const version : {"\xd9\xa9", "9.\xd9\xa1", "9\331\2411", "\xb2", "9.\xb9",
                                    "9\2631", "\xef\xbc\x99", "9.\xff.1", "9\2001"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_FALSE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, false));
  }
}

TEST(IsVersionValid, TellsEveryByteAlone) {
  for (int byte = 1; byte < 256; ++byte) {
    const std::string version(1, static_cast<char>(byte));
    EXPECT_EQ(isVersionValid(version.c_str()), byte >= '0' && byte <= '9') << byte;
    const std::string inside = "9" + version + "1";
    EXPECT_EQ(isVersionValid(inside.c_str()), byte == '.' || (byte >= '0' && byte <= '9')) << byte;
  }
}

TEST(IsVersionValid, OfNullIsFalseWithoutAMessage) {
  const Records records;

  EXPECT_FALSE(isVersionValid(nullptr));

  EXPECT_EQ(records.trail(), call("isVersionValid", 0));
}

TEST(IsVersionValid, AnswersTheSameWithTracingOff) {
  const Records records(0);

  EXPECT_TRUE(isVersionValid("9.1.0.2"));
  EXPECT_FALSE(isVersionValid("9.1."));

  EXPECT_THAT(records.all(), IsEmpty());
}

}  // namespace
