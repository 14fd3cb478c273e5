#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_registryutils.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// ---- Lines ----

TEST_F(GetXQ4PathAndVersion, OfAnEmptyFileIsNullAndSilent) {
  migrationFile("");
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
  EXPECT_EQ(findPath(), "(none)");
}

TEST_F(GetXQ4PathAndVersion, OfAFileWithoutTheKeysIsNullAndSilent) {
  migrationFile("\n\n# nothing\nother=/opt\n=\n");
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, TakesTheLinesInEitherOrder) {
  EXPECT_EQ(findIn(std::string(kVersionLine) + kPathLine), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesALastLineWithoutANewline) {
  EXPECT_EQ(findIn("currentXQ4Version=9.1.0.2\ncurrentXQ4InstallPath=/opt/xq4/V9.1/"), kBothFound);
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt/xq4/V9.1/\ncurrentXQ4Version=9.1.0.2"), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, FindsAKeyWhereverItStandsInItsLine) {
  for (const char* const contents :
       {"# currentXQ4Version=9.1\n#currentXQ4InstallPath=/opt/xq4\n",
        "  currentXQ4Version=9.1\n\tcurrentXQ4InstallPath=/opt/xq4\n",
        "oldcurrentXQ4VersionOfThis=9.1\nmycurrentXQ4InstallPath2 is =/opt/xq4\n",
        "! currentXQ4Version currentXQ4Version=9.1\n\xff currentXQ4InstallPath:=/opt/xq4\n"}) {
    SCOPED_TRACE(contents);
    EXPECT_EQ(findIn(contents), (Found{"/opt/xq4", "9.1"}));
  }
}

TEST_F(GetXQ4PathAndVersion, FindsAKeyAsItIsSpeltOnly) {
  EXPECT_EQ(findIn("currentxq4installpath=/opt/xq4\nCURRENTXQ4VERSION=9.1\n"
                   "currentXQ4Install Path=/opt/xq4\ncurrentXQ4Versio=9.1\n"
                   "InstallPath=/opt/xq4\nVersion=9.1\n"),
            kNothing);
}

TEST_F(GetXQ4PathAndVersion, LooksAtTheFirstEqualsSignOnly) {
  EXPECT_EQ(findIn("a=currentXQ4InstallPath=/wrong\n= currentXQ4Version=8\n"), kNothing);
  EXPECT_EQ(findIn("a=currentXQ4InstallPath=/wrong\n= currentXQ4Version=8\n" + kBothLines),
            kBothFound);
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt/a=b=\ncurrentXQ4Version=9\n"),
            (Found{"/opt/a=b=", "9"}));
}

TEST_F(GetXQ4PathAndVersion, PassesOverAKeyWithoutAnEqualsSign) {
  EXPECT_EQ(findIn("currentXQ4InstallPath\ncurrentXQ4Version\ncurrentXQ4InstallPath /opt\n"),
            kNothing);
  EXPECT_EQ(findIn("currentXQ4InstallPath\n=/wrong\ncurrentXQ4Version 8\n" + kBothLines),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesTheFirstOfRepeatedKeys) {
  EXPECT_EQ(findIn(kBothLines + "currentXQ4InstallPath=/later\ncurrentXQ4Version=10\n"),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, NeverLooksAtALaterVersion) {
  migrationFile(kBothLines + "currentXQ4Version=bad\n");
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.1.0.2\n"));
}

TEST_F(GetXQ4PathAndVersion, TakesOneValueFromOneLine) {
  const std::string both = "currentXQ4InstallPath=/opt/xq4 currentXQ4Version=9.1\n";
  EXPECT_EQ(findIn(both), kNothing);
  EXPECT_EQ(findIn(both + kVersionLine), (Found{"/opt/xq4 currentXQ4Version=9.1", "9.1.0.2"}));
  // Both keys are before one "=": each line sets one value.
  const std::string shared = "currentXQ4Version currentXQ4InstallPath=9.1\n";
  EXPECT_EQ(findIn(shared), kNothing);
  EXPECT_EQ(findIn("# " + shared), kNothing);
  EXPECT_EQ(findIn(shared + shared), (Found{"9.1", "9.1"}));
}

TEST_F(GetXQ4PathAndVersion, TakesTheVersionOfALineWhosePathKeyComesTooLate) {
  EXPECT_EQ(findIn("currentXQ4Version=9.1 currentXQ4InstallPath=/opt/xq4\n"),
            (Found{"(none)", "(none)"}));

  const std::vector<CatalogueMessage> messages = takeCatalogueMessages();
  EXPECT_EQ(messages.size(), 1U);  // the rest of the line is part of the version
}

TEST_F(GetXQ4PathAndVersion, EndsALineAtANulByte) {
  using namespace std::string_literals;
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt\0/hidden\ncurrentXQ4Version=9.1\0.x\n"s),
            (Found{"/opt", "9.1"}));
  EXPECT_EQ(findIn("\0currentXQ4InstallPath=/opt\n\0\n#\0currentXQ4Version=9\n"s), kNothing);
  EXPECT_EQ(findIn("\0currentXQ4InstallPath=/opt\n\0\n#\0currentXQ4Version=9\n\0\n"s + kBothLines),
            kBothFound);
  EXPECT_EQ(findIn("currentXQ4Version=9\ncurrentXQ4InstallPath=/opt\0"s), (Found{"/opt", "9"}));
}

TEST_F(GetXQ4PathAndVersion, CountsTheCharactersAfterANulByteToo) {
  const std::string nuls(kLongestLine - strlen("currentXQ4InstallPath=/opt"), '\0');
  EXPECT_EQ(findIn(kVersionLine + ("currentXQ4InstallPath=/opt" + nuls) + "\n"),
            (Found{"/opt", "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + ("currentXQ4InstallPath=/opt" + nuls) + std::string(1, '\0') +
                   "\n" + kPathLine),
            (Found{"(none)", "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, TakesALineOfTheGreatestLengthWhole) {
  const std::string line = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  const std::string path = line.substr(line.find('=') + 1);
  EXPECT_EQ(path.size(), 1001U);

  EXPECT_EQ(findIn(line + "\n" + kVersionLine), (Found{path, "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + line + "\n"), (Found{path, "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + line), (Found{path, "9.1.0.2"}));  // the last line of the file
}

TEST_F(GetXQ4PathAndVersion, GoesOnAfterLinesOfTheGreatestLength) {
  const std::string line(kLongestLine, '#');
  EXPECT_EQ(findIn(line + "\n" + kPathLine + line + "\n" + line + "\n\n\n" + kVersionLine + line),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALongerLineNorOfWhatFollows) {
  for (const size_t length : {kLongestLine + 1, 2 * kLongestLine, 2 * kLongestLine + 1,
                              size_t{5000}, kBlock, 3 * kBlock + 1}) {
    for (const char* const end : {"", "\n"}) {
      SCOPED_TRACE(std::to_string(length) + end);
      const std::string path_line = filled("currentXQ4InstallPath=/opt/x", length) + end;
      const std::string version_line = filled("currentXQ4Version=1", length) + end;
      const std::string other_line = std::string(length, '#') + end;

      EXPECT_EQ(findIn(kVersionLine + path_line), (Found{"(none)", "9.1.0.2"}));
      EXPECT_EQ(findPathIn(kVersionLine + path_line), "(none)");
      EXPECT_EQ(findIn(kPathLine + version_line), kNothing);
      EXPECT_EQ(findIn(kPathLine + other_line + kVersionLine), kNothing);
      EXPECT_EQ(findPathIn(kPathLine + other_line), "/opt/xq4/V9.1");
      EXPECT_EQ(findIn(other_line + kBothLines), kNothing);
      EXPECT_EQ(findIn(kBothLines + other_line), kBothFound);
      EXPECT_EQ(findIn(kBothLines + other_line + kVersionLine), kBothFound);
    }
  }
}

TEST_F(GetXQ4PathAndVersion, TakesNoLaterPieceOfALongLineForALine) {
  const std::string piece(kLongestLine, '#');
  EXPECT_EQ(findIn(piece + kPathLine + kVersionLine), kNothing);
  EXPECT_EQ(findIn(piece + piece + kPathLine + kVersionLine), kNothing);
  EXPECT_EQ(findIn(kVersionLine + piece + " \n" + kPathLine), (Found{"(none)", "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, CountsACarriageReturnAmongTheCharactersOfItsLine) {
  EXPECT_EQ(findIn(std::string(kLongestLine - 1, '#') + "\r\n" + kBothLines), kBothFound);
  EXPECT_EQ(findIn(std::string(kLongestLine, '#') + "\r\n" + kBothLines), kNothing);
}

TEST_F(GetXQ4PathAndVersion, ReadsLinesThatTwoBlocksShare) {
  const std::string longest = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  const std::string longest_path = longest.substr(longest.find('=') + 1);
  for (size_t before = kBlock - kBothLines.size() - 2; before <= kBlock + 2; ++before) {
    SCOPED_TRACE(before);
    EXPECT_EQ(findIn(fillerLines(before) + kBothLines), kBothFound);
  }
  for (const size_t before : {size_t{1}, kBlock - 2, kBlock - 1, kBlock, kBlock + 1}) {
    SCOPED_TRACE(before);
    EXPECT_EQ(findIn(fillerLines(before) + longest + "\n" + kVersionLine),
              (Found{longest_path, "9.1.0.2"}));
    EXPECT_EQ(findIn(fillerLines(before) + longest + "x\n" + kBothLines), kNothing);
  }
}

TEST_F(GetXQ4PathAndVersion, ReadsTheFileToItsEndThoughBothAreFound) {
  migrationFile(kBothLines + fillerLines(3 * kBlock));
  const FailingCall reading(Call::fread, 0, kNever);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_GE(reading.calls(), 4);
}

// ---- Values ----

TEST_F(GetXQ4PathAndVersion, TrimsThePathsWhiteSpaceAndThenOneSeparator) {
  struct Case {
    const char* value;
    const char* path;
  };
  for (const auto& [value, path] : {Case{"/opt/xq4", "/opt/xq4"},
                                    {"/opt/xq4/", "/opt/xq4"},
                                    {"/opt/xq4//", "/opt/xq4/"},
                                    {"/opt/xq4\\", "/opt/xq4"},
                                    {"/opt/xq4\\\\", "/opt/xq4\\"},
                                    {"/opt/xq4/\\", "/opt/xq4/"},
                                    {"/opt/xq4  \r", "/opt/xq4"},
                                    {"/opt/xq4 \t\r \t", "/opt/xq4"},
                                    {"/opt/xq4/ ", "/opt/xq4"},
                                    {"/opt/xq4/\r", "/opt/xq4"},
                                    {"/opt/xq4 /", "/opt/xq4 "},
                                    {"/opt/xq4/ /", "/opt/xq4/ "},
                                    {"/opt/xq4\v", "/opt/xq4\v"},
                                    {"/opt/xq4\f", "/opt/xq4\f"},
                                    {"/opt/xq4\xa0", "/opt/xq4\xa0"},
                                    {" /opt/xq4", " /opt/xq4"},
                                    {"\t/opt xq4/x", "\t/opt xq4/x"},
                                    {"\"/opt/xq4\"", "\"/opt/xq4\""},
                                    {"C:\\xq4\\", "C:\\xq4"},
                                    {"/100%s%n", "/100%s%n"},
                                    {"", ""},
                                    {" \t\r", ""},
                                    {"/", ""},
                                    {"\\", ""},
                                    {" /", " "},
                                    {"//", "/"},
                                    {"=", "="}}) {
    SCOPED_TRACE(value);
    EXPECT_EQ(findIn("currentXQ4InstallPath=" + std::string(value) + "\ncurrentXQ4Version=9\n"),
              (Found{path, "9"}));
  }
}

TEST_F(GetXQ4PathAndVersion, TakesTheBlanksAroundTheEqualsSignIntoTheValue) {
  EXPECT_EQ(findPathIn("currentXQ4InstallPath = /opt/xq4\n"), " /opt/xq4");
}

TEST_F(GetXQ4PathAndVersion, RefusesAVersionThatIsNotOneToItsLastCharacter) {
  for (const char* const version : {"", " 9.1", "9.1 ", "9.1\t", "9.1\r", "9.1/", "9.1.", ".9",
                                    "9..1", "9.1.0.2.3", "9.1=2", "9.1%s%n", "x"}) {
    SCOPED_TRACE(version);
    const std::string file =
        migrationFile(kPathLine + ("currentXQ4Version=" + std::string(version)) + "\n");
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

    expectComplaint(file);
    EXPECT_EQ(records.trail(),
              discovery(readable(), accessible(), versionCheck(version, false), shortname()));
    expectBlocks(live, 1);  // the path, which is not returned
  }
}

TEST_F(GetXQ4PathAndVersion, ReadsNoFurtherAfterAnInvalidVersion) {
  const std::string file = migrationFile("currentXQ4Version=9.x\n" + kBothLines);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  expectComplaint(file);
  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.x\n"));
}

TEST_F(GetXQ4PathAndVersion, ComplainsAboutTheVersionOfAFileWithCarriageReturns) {
  const std::string file =
      migrationFile("currentXQ4InstallPath=/opt/xq4/\r\ncurrentXQ4Version=9.1\r\n");

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));
  expectComplaint(file);

  EXPECT_EQ(findPath(), "/opt/xq4");
}

TEST_F(GetXQ4PathAndVersion, KeepsTheVersionAlthoughThereIsNoPath) {
  migrationFile(kVersionLine);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname()));
}

TEST_F(GetXQ4PathAndVersion, IsNullWithoutTheVersionThatIsWanted) {
  migrationFile(kPathLine);
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, NeedsThePathOnlyWhenNoVersionIsWanted) {
  migrationFile(kPathLine);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(findPath(), "/opt/xq4/V9.1");

  EXPECT_EQ(records.trail(), silence());
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, NeverLooksAtAVersionThatIsNotWanted) {
  migrationFile(std::string("currentXQ4Version=bad\n") + kPathLine);
  const Records records;

  EXPECT_EQ(findPath(), "/opt/xq4/V9.1");

  EXPECT_THAT(records.texts(), IsEmpty());
}

TEST_F(GetXQ4PathAndVersion, NeedsThePathWhenNoVersionIsWanted) {
  EXPECT_EQ(findPathIn(kVersionLine), "(none)");
}

}  // namespace
