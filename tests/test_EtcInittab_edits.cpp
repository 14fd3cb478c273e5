// EtcInittab: adding and deleting.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "editors.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

namespace {

// ---- Adding ----

TEST_F(EtcInittabTest, AddedEntryIsFoundWithoutLoadingAgain) {
  writeFile(path, "");
  InittabEditor inittab;

  EXPECT_EQ(inittab.add({"vra0", "2", "once", "/bin/x"}), OSUTILS_SUCCESS);

  EXPECT_TRUE(inittab.doesInittabEntryExist("vra0"));
  EXPECT_TRUE(inittab.isCommandRegistered("bin/x"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("/bin/x")), "vra0");
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra1");
  EXPECT_EQ(inittab.add({"vra0", "3", "off", "/bin/y"}), OSUTILS_ALREADY_EXISTS);
}

TEST_F(EtcInittabTest, AddsACommandThatIsThereUnderAnotherId) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.add({"zz", "2", "respawn", "/bin/alpha"}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), alpha_line + "zz:2:respawn:/bin/alpha\n");
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("/bin/alpha")), "zz") << "the head";
}

TEST_F(EtcInittabTest, AddsFieldsAsTheyStandWithoutLookingAtThem) {
  writeFile(path, "");
  InittabEditor inittab;

  EXPECT_EQ(inittab.add({"a:b", "", "", ""}), OSUTILS_SUCCESS);
  EXPECT_EQ(inittab.add({"", "", "", ""}), OSUTILS_SUCCESS);
  EXPECT_EQ(inittab.add({"#c", " ", "%s%n", "100% \\ \"x\"\t"}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "a:b:::\n:::\n#c: :%s%n:100% \\ \"x\"\t\n");
  EXPECT_TRUE(inittab.doesInittabEntryExist("a:b"));
  EXPECT_TRUE(inittab.doesInittabEntryExist(""));
  EXPECT_EQ(inittab.add({"", "2", "once", "x"}), OSUTILS_ALREADY_EXISTS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"a", "b", "", ":"}));
}

TEST_F(EtcInittabTest, RefusesAListedIdBeforeItLooksAtTheFile) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);
  Records records;

  EXPECT_EQ(inittab.add({"al", "5", "off", "/bin/other"}), OSUTILS_ALREADY_EXISTS);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("addInittabEntry", 68, kListed)));

  EXPECT_EQ(inittab.add(kBeta), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_FALSE(pathExists(path));
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
}

TEST_F(EtcInittabTest, AddsLongFieldsWholeButRemembersTheirBeginning) {
  for (const size_t more : {0U, 1U, 2U, 50U, 1000U}) {
    SCOPED_TRACE(more);
    const Entry whole = {std::string(9 + more, 'i'), std::string(9 + more, 'r'),
                         std::string(29 + more, 'a'), std::string(255 + more, 'c')};
    const Entry kept = {whole.id.substr(0, 10), whole.runlevels.substr(0, 10),
                        whole.action.substr(0, 30), whole.process.substr(0, 256)};
    fill("");
    InittabEditor inittab;

    EXPECT_EQ(inittab.add(whole), OSUTILS_SUCCESS);

    EXPECT_EQ(contentsOf(path),
              whole.id + ":" + whole.runlevels + ":" + whole.action + ":" + whole.process + "\n");
    EXPECT_THAT(listOf(inittab), ElementsAre(kept));
    EXPECT_EQ(inittab.doesInittabEntryExist(whole.id.c_str()), more == 0);
    EXPECT_EQ(inittab.isCommandRegistered(whole.process.c_str()), more <= 1);
    EXPECT_TRUE(inittab.isCommandRegistered(kept.process.c_str()));
  }
}

TEST_F(EtcInittabTest, CommandOfMoreThan256CharactersIsReadBackCut) {
  const std::string command(300, 'c');
  writeFile(path, "");
  InittabEditor inittab;
  EXPECT_EQ(inittab.add({"al", "2", "once", command}), OSUTILS_SUCCESS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"al", "2", "once", command.substr(0, 256)}));
  EXPECT_EQ(contentsOf(path), "al:2:once:" + command + "\n");
}

TEST_F(EtcInittabTest, AddsACommandOf100000Characters) {
  const std::string command(100000, 'c');
  writeFile(path, "");
  InittabEditor inittab;

  EXPECT_EQ(inittab.add({"al", "2", "once", command}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "al:2:once:" + command + "\n");
  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"al", "2", "once", command.substr(0, 256)}));
}

// ---- Deleting ----

TEST_F(EtcInittabTest, DeletesAllLinesOfAnIdButOnlyItsFirstRecord) {
  writeFile(path, alpha_line + beta_line + "al:5:off:/bin/other\nal:no colon more\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), beta_line);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta, Entry{"al", "5", "off", "/bin/other"},
                                           Entry{"al", "no colon m", "ore\n", ""}));
  EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
  EXPECT_EQ(inittab.add(kAlpha), OSUTILS_ALREADY_EXISTS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  EXPECT_FALSE(inittab.doesInittabEntryExist("al"));
}

TEST_F(EtcInittabTest, DeleteKeepsEveryOtherLineAsItStands) {
  using namespace std::string_literals;
  const std::string kept =
      "# al:2:once:x\n\n   \t\n#al:\n:al:2\nal\nal \nal :2:once:x\nal\t:2:once:x\n"
      " \t be  :2:once:al:x # al:\r\nAl:2:once:x\nalp:2:once:x\na:2:once:x\n1al:2\nAL:\n"
      "x:al:al:al\nnul\0al:2:once:x\0\n"s;
  EXPECT_EQ(without("al", kept + alpha_line + kept), kept + kept);
  EXPECT_EQ(without("al", " \t\v\f\r al:2\n" + kept), kept);
  EXPECT_EQ(without("al", kept + "al:2"), kept);
  EXPECT_EQ(without("al", alpha_line + kept + "be:2"), kept + "be:2");
  EXPECT_EQ(without("al", "al:2:once:x\r\nbe:2:once:x\r\n"), "be:2:once:x\r\n");
  EXPECT_EQ(without("al", "al:"), "");
  EXPECT_EQ(without("Al", "al:2:once:x\nAl:2:once:x\n"), "al:2:once:x\n");
  EXPECT_EQ(without("1", "1:2345:respawn:/sbin/getty\n11:2:once:x\n"), "11:2:once:x\n");
}

TEST_F(EtcInittabTest, DeleteTakesTrailingBlanksForPartOfTheId) {
  EXPECT_EQ(without("al", "al:2:once:x\nal :2:once:x\n"), "al :2:once:x\n");
  EXPECT_EQ(without("al ", "al:2:once:x\nal :2:once:x\n"), "al:2:once:x\n");
  EXPECT_EQ(without("a l", "a l:2:once:x\na:2:once:x\n"), "a:2:once:x\n");
}

TEST_F(EtcInittabTest, DeleteComparesTheNewlineOfALineWithoutAColon) {
  EXPECT_EQ(without("al", "al\nal:2\nal\n"), "al\nal\n");
  EXPECT_EQ(without("al", "be:2\nal"), "be:2\n");
  EXPECT_EQ(without("al", "al:2\nalp"), "alp");
  EXPECT_EQ(without("al\n", "al\nal:2\nal\nal"), "al:2\nal");
}

TEST_F(EtcInittabTest, LineWithoutAColonIsNotTheLineOfItsText) {
  fill("al\nvra0\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_FALSE(inittab.doesInittabEntryExist("al"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("al\n"));
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra0");
  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_EQ(contentsOf(path), "al\nvra0\n");
  EXPECT_EQ(inittab.add(kAlpha), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), "al\nvra0\n" + alpha_line);
}

// The call frees the record that holds its argument.
TEST_F(EtcInittabTest, DeletesByTheIdOfTheRecordItself) {
  fill(alpha_line + beta_line);
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry(inittab.getInittabEntry("al")->id), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), beta_line);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta));
}

TEST_F(EtcInittabTest, DeleteTakesALineWhoseIdEndsAtANul) {
  using namespace std::string_literals;
  EXPECT_EQ(without("al", "al:2\nal\0more:2\nal\0more\nbe:2\n"s), "be:2\n");
}

TEST_F(EtcInittabTest, DeleteOfAnIdWithAColonFindsNoLine) {
  fill("a:b:2:once:x\n");
  InittabEditor inittab;
  ASSERT_EQ(inittab.add({"a:b", "2", "once", "x"}), OSUTILS_SUCCESS);
  const std::string contents = contentsOf(path);

  EXPECT_EQ(inittab.deleteInittabEntry("a:b"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), contents);
  EXPECT_THAT(listOf(inittab), IsEmpty());
}

TEST_F(EtcInittabTest, DeleteKeepsTheLineOfAnIdThatTheFileDoesNotHave) {
  for (const char* const id : {"#c", "", "-x"}) {
    SCOPED_TRACE(id);
    fill(alpha_line);
    InittabEditor inittab;
    ASSERT_EQ(inittab.add({id, "2", "once", "x"}), OSUTILS_SUCCESS);

    EXPECT_EQ(inittab.deleteInittabEntry(id), OSUTILS_SUCCESS);

    EXPECT_EQ(contentsOf(path), alpha_line + id + ":2:once:x\n");
    EXPECT_THAT(listOf(inittab), IsEmpty());
  }
}

TEST_F(EtcInittabTest, DeleteTakesLongLinesPieceByPiece) {
  std::string line = "al:2:once:" + std::string(5000, 'x') + "\n";
  EXPECT_EQ(without("al", line + beta_line), line.substr(1023) + beta_line);

  // The second piece is deleted with its newline, so the next line joins the first piece.
  const std::string blanks(1023, ' ');
  EXPECT_EQ(without("al", blanks + alpha_line + beta_line), blanks + beta_line);
  // A full piece has no newline, like the last line of a file: the id alone matches.
  const std::string piece = std::string(1021, ' ') + "al";
  EXPECT_EQ(without("al", alpha_line + piece + "x\n"), "x\n");
  EXPECT_EQ(without("al", alpha_line + piece.substr(1) + "x\n"), piece.substr(1) + "x\n");
  for (const size_t length : {1022U, 1023U, 1024U, 1025U}) {
    SCOPED_TRACE(length);
    line = "al:2:once:";
    line += std::string(length - line.size() - 1, '#') + "\n";
    EXPECT_EQ(without("al", line + beta_line),
              (length <= 1023 ? "" : line.substr(1023)) + beta_line);
    EXPECT_EQ(without("be", line + beta_line), line);
  }
}

TEST_F(EtcInittabTest, DeleteOfAnUnlistedIdLooksAtNoFile) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);

  for (const char* const id : {"be", "Al", "al ", "al:", ""}) {
    const Records records;
    EXPECT_EQ(inittab.deleteInittabEntry(id), OSUTILS_NO_SUCH_OBJECT);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("deleteInittabEntry", 32, kNotListed)));
  }
}

// ---- /etc/inittab ----

TEST(EtcInittabOfTheSystem, IsEditedInPlaceUnlessTheProgramSaysOtherwise) {
  REQUIRE_ROOT("for a private /etc");
  EXPECT_EQ(
      withPrivateEtc([] {
        const std::string before = "# system\nid:3:initdefault:\n1:2345:respawn:/sbin/getty\n";
        writeFile("/etc/inittab", before);
        InittabEditor inittab;
        EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
        EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"id", "3", "initdefault", ""},
                                                 Entry{"1", "2345", "respawn", "/sbin/getty"}));
        const std::string id = taken(inittab.findAvaliableID());

        EXPECT_EQ(inittab.add({id, "2345", "once", "/opt/bin/start > /dev/null 2>&1"}),
                  OSUTILS_SUCCESS);
        EXPECT_EQ(contentsOf("/etc/inittab"),
                  before + "vra0:2345:once:/opt/bin/start > /dev/null 2>&1\n");

        std::string copied;
        const BeforeCall opened(
            Call::fopen64, [&] { copied = contentsOf("/etc/inittab.vrasave"); }, 3);
        EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS);
        EXPECT_TRUE(opened.fired());
        EXPECT_EQ(copied, before + "vra0:2345:once:/opt/bin/start > /dev/null 2>&1\n");
        EXPECT_EQ(contentsOf("/etc/inittab"), before);
        EXPECT_FALSE(pathExists("/etc/inittab.vrasave"));
        return 0;
      }),
      0);
}

}  // namespace
