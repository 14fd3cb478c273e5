#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <utility>

#include "ldtr.h"
#include "test_ldtr.h"

namespace {

class SaferVsprintf : public testing::Test {
 protected:
  SaferVsprintf() : text_(100'000, 'z') {}

  // Larger than any text here, so that overruns of the size that is passed stay inside.
  char* dst() { return text_.data(); }
  std::string result() const { return text_.c_str(); }

  std::string text_;
};

TEST_F(SaferVsprintf, FormatsLikeItsModel) {
  EXPECT_EQ(safer(100, dst(), "%d, %s and %5.2f", 1, "two", 3.0), 0);
  EXPECT_EQ(result(), "1, two and  3.00");
}

TEST_F(SaferVsprintf, RefusesWhatItIsNotGivenInThisOrder) {
  EXPECT_EQ(safer(0, nullptr, nullptr), 1);
  EXPECT_EQ(safer(10, nullptr, "x"), 1);
  EXPECT_EQ(safer(0, dst(), nullptr), 2);
  EXPECT_EQ(safer(-1, dst(), "x"), 2);
  EXPECT_EQ(safer(1, dst(), nullptr), 3);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
}

TEST_F(SaferVsprintf, WantsAFormatShorterThanTheBuffer) {
  EXPECT_EQ(safer(10, dst(), "0123456789"), 5);
  EXPECT_EQ(safer(1, dst(), "0"), 5);
  EXPECT_EQ(safer(500, dst(), std::string(500, 'x').c_str()), 5);  // checked before 6
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(10, dst(), "012345678"), 0);
  EXPECT_EQ(result(), "012345678");
}

TEST_F(SaferVsprintf, WantsAFormatOfAtMost499Characters) {
  EXPECT_EQ(safer(1000, dst(), std::string(500, 'x').c_str()), 6);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), std::string(499, 'x').c_str()), 0);
  EXPECT_EQ(result(), std::string(499, 'x'));
}

TEST_F(SaferVsprintf, WantsRoomForTheBoundBeforeEachConversion) {
  EXPECT_EQ(safer(1000, dst(), (std::string(492, 'x') + "%s").c_str(), "y"), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), (std::string(491, 'x') + "%s").c_str(), "y"), 0);
  EXPECT_EQ(result(), std::string(491, 'x') + "y");
}

TEST_F(SaferVsprintf, WantsRoomForTheTail) {
  EXPECT_EQ(safer(1000, dst(), ("%s" + std::string(492, 'x')).c_str(), "y"), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), ("%s" + std::string(491, 'x')).c_str(), "y"), 0);
  EXPECT_EQ(result(), "y" + std::string(491, 'x'));
}

// Calls it with one "%s" for each index, each printing "y".
template <size_t... Index>
int saferMany(char* dst, std::index_sequence<Index...>) {
  std::string format;
  for (size_t count = 0; count < sizeof...(Index); ++count) format += "%s";
  return safer(1000, dst, format.c_str(), (static_cast<void>(Index), "y")...);
}

TEST_F(SaferVsprintf, HasRoomFor62Bounds) {
  EXPECT_EQ(saferMany(dst(), std::make_index_sequence<63>()), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(saferMany(dst(), std::make_index_sequence<62>()), 0);
  EXPECT_EQ(result(), std::string(62, 'y'));
}

TEST_F(SaferVsprintf, CutsEveryPlainStringAt1000Characters) {
  for (const size_t length : {999U, 1000U, 1001U, 2000U, 50'000U}) {
    SCOPED_TRACE(length);
    const std::string argument(length, 'a');
    const std::string printed(length < 1000 ? length : 1000, 'a');
    EXPECT_EQ(safer(10'000, dst(), "<%s|%s>", argument.c_str(), argument.c_str()), 0);
    EXPECT_EQ(result(), "<" + printed + "|" + printed + ">");
  }
}

TEST_F(SaferVsprintf, LeavesStringsWithFlagsWidthOrPrecisionAsTheyAre) {
  const std::string argument(2000, 'a');
  EXPECT_EQ(safer(10'000, dst(), "%-1s", argument.c_str()), 0);
  EXPECT_EQ(result(), argument);
  EXPECT_EQ(safer(10'000, dst(), "%1500s", "b"), 0);
  EXPECT_EQ(result(), std::string(1499, ' ') + "b");
  EXPECT_EQ(safer(10'000, dst(), "%.1200s", argument.c_str()), 0);
  EXPECT_EQ(result(), std::string(1200, 'a'));
}

TEST_F(SaferVsprintf, PassesOverADoubledPercentSign) {
  EXPECT_EQ(safer(100, dst(), "100%%s"), 0);
  EXPECT_EQ(result(), "100%s");
  const std::string argument(2000, 'a');
  EXPECT_EQ(safer(10'000, dst(), "%%%s%%%%s", argument.c_str()), 0);
  EXPECT_EQ(result(), "%" + std::string(1000, 'a') + "%%s");
}

TEST_F(SaferVsprintf, WritesAnEmptyTextForAnEmptyFormat) {
  EXPECT_EQ(safer(1, dst(), ""), 0);
  EXPECT_EQ(result(), "");
  EXPECT_EQ(text_[1], 'z');
}

TEST_F(SaferVsprintf, PassesAPercentSignAtTheEndOnToItsModel) {
  EXPECT_EQ(safer(100, dst(), "50%"), 8);  // the C library refuses it
}

TEST_F(SaferVsprintf, ReportsATextThatCannotBeFormatted) {
  EXPECT_EQ(safer(100, dst(), "%ls", kUnprintable), 8);
}

TEST_F(SaferVsprintf, ReportsATextThatHasOverrunTheBuffer) {
  EXPECT_EQ(safer(10, dst(), "%s", "012345678"), 0);
  EXPECT_EQ(result(), "012345678");
  EXPECT_EQ(safer(10, dst(), "%s", "0123456789"), 9);
  EXPECT_EQ(result(), "0123456789");  // the buffer has been overrun
  EXPECT_EQ(safer(1000, dst(), "%s", std::string(2000, 'a').c_str()), 9);
  EXPECT_EQ(safer(1001, dst(), "%s", std::string(2000, 'a').c_str()), 0);
}

TEST_F(SaferVsprintf, MissesAnOverrunThatLeavesTheLastByteZero) {
  EXPECT_EQ(safer(4, dst(), "%c%c", 'a', 'b'), 5);  // the format itself is too long
  EXPECT_EQ(safer(5, dst(), "%s", "abcd\0"), 0);
  EXPECT_EQ(safer(6, dst(), "%3d%c", 1, '\0'), 0);
  EXPECT_EQ(safer(6, dst(), "%5d%c", 1, '\0'), 0);
  EXPECT_EQ(safer(7, dst(), "%6d%c", 1, '\0'), 0);
}

}  // namespace
