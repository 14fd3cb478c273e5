// EtcInittab: the entries that it reads from a file.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stddef.h>
#include <string.h>

#include <string>
#include <vector>

#include "editors.h"
#include "osutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

TEST_F(EtcInittabTest, LoadsOneRecordForEachEntryInTheOrderOfTheFile) {
  EXPECT_THAT(loaded("# a comment:2:once:x\n"
                     "\n"
                     "zeta:2345:respawn:/sbin/getty 38400 tty1\n"
                     " \t be:3:once:/bin/beta\n"
                     "1:2345:respawn:/sbin/getty\n"
                     "zeta:5:off:/bin/again\n"
                     "+sign:1:once:x\n"
                     "-sign:1:once:x\n"
                     "_low:1:once:x\n"
                     ":1:once:x\n"
                     "   # indented\n"
                     "\xE4:1:once:x\n"
                     "Id::ctrlaltdel:/sbin/shutdown -t1 -a -r now\n"
                     "\v\f\rga :2 : off : /bin/gamma: a:b # kept \n"),
              ElementsAre(Entry{"zeta", "2345", "respawn", "/sbin/getty 38400 tty1"},
                          Entry{"be", "3", "once", "/bin/beta"},
                          Entry{"1", "2345", "respawn", "/sbin/getty"},
                          Entry{"zeta", "5", "off", "/bin/again"},
                          Entry{"Id", "", "ctrlaltdel", "/sbin/shutdown -t1 -a -r now"},
                          Entry{"ga ", "2 ", " off ", " /bin/gamma: a:b # kept "}));
}

TEST_F(EtcInittabTest, LoadsTheLastLineOnceWithOrWithoutItsNewline) {
  EXPECT_THAT(loaded(alpha_line + beta_line.substr(0, beta_line.size() - 1)),
              ElementsAre(kAlpha, kBeta));
  EXPECT_THAT(loaded(alpha_line), ElementsAre(kAlpha));
  EXPECT_THAT(loaded("al:2:respawn:/bin/alpha"), ElementsAre(kAlpha));
  EXPECT_THAT(loaded("a"), ElementsAre(Entry{"a", "", "", ""}));
  EXPECT_THAT(loaded(""), IsEmpty());
  EXPECT_THAT(loaded("\n\n"), IsEmpty());
}

TEST_F(EtcInittabTest, CarriageReturnBelongsToTheLastField) {
  EXPECT_THAT(
      loaded("al:2:respawn:/bin/alpha\r\nbe:2\r\n"),
      ElementsAre(Entry{"al", "2", "respawn", "/bin/alpha\r"}, Entry{"be", "2\r\n", "", ""}));
}

// In a line with too few fields the last one contains the newline. A deletion compares the id in the
// same way.
TEST_F(EtcInittabTest, FieldsThatALineDoesNotHaveAreEmpty) {
  // The long first line fills the buffer beyond the end of the second one.
  const std::string before = "al:2:respawn:" + std::string(1000, 'x') + "\n";
  const struct {
    const char* line;
    Entry at_the_end;
    Entry entry;
  } cases[] = {
      {"b", {"b", "", "", ""}, {"b\n", "", "", ""}},
      {"b:", {"b", "", "", ""}, {"b", "\n", "", ""}},
      {"b:2", {"b", "2", "", ""}, {"b", "2\n", "", ""}},
      {"b:2:", {"b", "2", "", ""}, {"b", "2", "\n", ""}},
      {"b:2:once", {"b", "2", "once", ""}, {"b", "2", "once\n", ""}},
      {"b:2:once:", {"b", "2", "once", ""}, {"b", "2", "once", ""}},
      {"b::", {"b", "", "", ""}, {"b", "", "\n", ""}},
      {"b:::", {"b", "", "", ""}, {"b", "", "", ""}},
      {"b::::", {"b", "", "", ":"}, {"b", "", "", ":"}},
      {"b:::x", {"b", "", "", "x"}, {"b", "", "", "x"}},
      {"b word 2", {"b word 2", "", "", ""}, {"b word 2\n", "", "", ""}},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.line);
    const Entry first = {"al", "2", "respawn", std::string(256, 'x')};
    EXPECT_THAT(loaded(before + with.line + "\n" + gamma_line),
                ElementsAre(first, with.entry, kGamma));
    EXPECT_THAT(loaded(before + with.line), ElementsAre(first, with.at_the_end));
  }
}

TEST_F(EtcInittabTest, FieldThatIsTooLongIsCutAndItsRestBeginsTheNext) {
  const auto x = [](size_t length) { return std::string(length, 'x'); };
  const struct {
    std::string line;
    Entry entry;
  } cases[] = {
      {x(9) + ":2:once:cmd", {x(9), "2", "once", "cmd"}},
      {x(10) + ":2:once:cmd", {x(10), "2", "once", "cmd"}},
      {x(11) + ":2:once:cmd", {x(10), "x", "2", "once:cmd"}},
      {x(20) + ":2:once:cmd", {x(10), x(10), "2", "once:cmd"}},
      {x(21) + ":2:once:cmd", {x(10), x(10), "x", "2:once:cmd"}},
      {x(50) + ":2:once:cmd", {x(10), x(10), x(30), "2:once:cmd"}},
      {x(51) + ":2:once:cmd", {x(10), x(10), x(30), "x:2:once:cmd"}},
      {"a:" + x(9) + ":once:cmd", {"a", x(9), "once", "cmd"}},
      {"a:" + x(10) + ":once:cmd", {"a", x(10), "once", "cmd"}},
      {"a:" + x(11) + ":once:cmd", {"a", x(10), "x", "once:cmd"}},
      {"a:2:" + x(29) + ":cmd", {"a", "2", x(29), "cmd"}},
      {"a:2:" + x(30) + ":cmd", {"a", "2", x(30), "cmd"}},
      {"a:2:" + x(31) + ":cmd", {"a", "2", x(30), "x:cmd"}},
      {"a:2:once:" + x(255), {"a", "2", "once", x(255)}},
      {"a:2:once:" + x(256), {"a", "2", "once", x(256)}},
      {"a:2:once:" + x(257), {"a", "2", "once", x(256)}},
      {"a:2:once:" + x(900), {"a", "2", "once", x(256)}},
      {x(50), {x(10), x(10), x(30), ""}},
      {x(51), {x(10), x(10), x(30), "x"}},
      {x(10) + "::once:", {x(10), "", "once", ""}},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.line);
    EXPECT_THAT(loaded(with.line + "\n" + gamma_line), ElementsAre(with.entry, kGamma));
    EXPECT_THAT(loaded(with.line), ElementsAre(with.entry));
  }
}

TEST_F(EtcInittabTest, FieldAsWideAsItsArrayMayEndTheLine) {
  const auto x = [](size_t length) { return std::string(length, 'x'); };
  EXPECT_THAT(loaded(x(10)), ElementsAre(Entry{x(10), "", "", ""}));
  EXPECT_THAT(loaded(x(20)), ElementsAre(Entry{x(10), x(10), "", ""}));
  // The newline is the rest of the field and begins the next one.
  EXPECT_THAT(loaded(x(10) + "\n" + gamma_line), ElementsAre(Entry{x(10), "\n", "", ""}, kGamma));
  EXPECT_THAT(loaded(x(20) + "\n" + gamma_line),
              ElementsAre(Entry{x(10), x(10), "\n", ""}, kGamma));
  EXPECT_THAT(loaded(x(9) + "\n" + gamma_line),
              ElementsAre(Entry{x(9) + "\n", "", "", ""}, kGamma));
}

TEST_F(EtcInittabTest, RecordIsZeroAfterEachValue) {
  fill("x0123456789:xx:yyy:" + std::string(300, 'z') + "\nal:2:respawn:/bin/alpha\n");
  InittabEditor inittab;
  inittab.readInittab();
  inittab.freeInittabEntries();  // so that new records reuse this memory
  fill(alpha_line);
  inittab.readInittab();
  inittab.add(kBeta);

  InittabEntry alpha = {};
  memcpy(alpha.id, "al", 2);
  memcpy(alpha.runlevels, "2", 1);
  memcpy(alpha.action, "respawn", 7);
  memcpy(alpha.process, "/bin/alpha", 10);
  InittabEntry beta = {};
  memcpy(beta.id, "be", 2);
  memcpy(beta.runlevels, "35", 2);
  memcpy(beta.action, "once", 4);
  memcpy(beta.process, "/bin/beta -x", 12);
  EXPECT_EQ(memcmp(headOf(inittab), &beta, offsetof(InittabEntry, next)), 0);
  EXPECT_EQ(memcmp(headOf(inittab)->next, &alpha, offsetof(InittabEntry, next)), 0);
}

// sic: a value that fills its array reads on into the next one.
TEST_F(EtcInittabTest, FullIdIsReadTogetherWithTheRunLevels) {
  fill("abcdefghij:2:once:/bin/full\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_FALSE(inittab.doesInittabEntryExist("abcdefghij"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("abcdefghij2"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("full")), "abcdefghij2");
  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij"), OSUTILS_NO_SUCH_OBJECT);

  // The record matches, but no line does.
  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij2"), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(contentsOf(path), "abcdefghij:2:once:/bin/full\n");
}

TEST_F(EtcInittabTest, RecordsWithTheSameFullIdAreToldApartByTheirRunLevels) {
  fill("abcdefghij:3:once:/bin/three\nabcdefghij:2:once:/bin/two\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij2"), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"abcdefghij", "3", "once", "/bin/three"}));
}

TEST_F(EtcInittabTest, FullIdEndsAtEmptyRunLevels) {
  fill("abcdefghij::once:/bin/full\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("full")), "abcdefghij");
  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij"), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(contentsOf(path), "");
}

TEST_F(EtcInittabTest, LongIdOfALineIsWholeAgainWhenReadOn) {
  const std::string id = "abcdefghijklmno";
  fill(id + ":2:once:/bin/full\n" + alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  EXPECT_EQ(entryOf(*headOf(inittab)), (Entry{"abcdefghij", "klmno", "2", "once:/bin/full"}));

  EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_EQ(contentsOf(path), alpha_line);
}

// At 10 and 20 characters the id fills its arrays without a NUL after it. From 50 on, the colon after
// the id is part of the command.
TEST_F(EtcInittabTest, LineGoesWithItsIdUnlessTheIdIsReadOnIntoTheNextField) {
  for (size_t length = 1; length <= 60; ++length) {
    SCOPED_TRACE(length);
    const std::string id(length, 'i');
    fill(id + ":2:once:/bin/long\n" + alpha_line);
    InittabEditor inittab;
    inittab.readInittab();
    const bool is_found = length != 10 && length != 20 && length < 50;

    const std::string id_of_first = taken(inittab.getEntryInitIDWithCommand(""));
    EXPECT_THAT(id_of_first, testing::StartsWith(id));
    EXPECT_EQ(id_of_first == id, is_found);
    EXPECT_EQ(inittab.doesInittabEntryExist(id.c_str()), is_found);
    EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()),
              is_found ? OSUTILS_SUCCESS : OSUTILS_NO_SUCH_OBJECT);
    EXPECT_EQ(contentsOf(path) == alpha_line, is_found);
  }
}

TEST_F(EtcInittabTest, FullFieldsAreReadAsOneIdUpToTheEndOfTheCommand) {
  const std::string id(10, 'i');
  const std::string runlevels(10, 'r');
  const std::string action(30, 'a');
  fill(id + ":" + runlevels + ":" + action + ":" + std::string(300, 'c') + "\n");
  InittabEditor inittab;
  inittab.readInittab();
  const std::string whole = id + runlevels + action + std::string(256, 'c');

  EXPECT_TRUE(inittab.doesInittabEntryExist(whole.c_str()));
  EXPECT_FALSE(inittab.doesInittabEntryExist((id + runlevels + action).c_str()));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("ccc")), whole);
}

TEST_F(EtcInittabTest, FullIdWithRunLevelsIsNotTakenForAFreeOne) {
  EtcInittab::ETC_INITTAB_PREFIX_ID = "prefix-of";
  fill("prefix-of0:2:once:/a\n");
  InittabEditor inittab;
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "prefix-of0")
      << "the id of the record reads prefix-of02";
  fill("prefix-of0::once:/a\n");
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "prefix-of1");
}

TEST_F(EtcInittabTest, EmbeddedNulEndsTheCommandButNoOtherField) {
  using namespace std::string_literals;
  fill("al\0x:2:respawn:/bin/al\0pha\nbe:\0:once\0:/bin/beta\n\0ga:2:off:/c\n \0ga\nde:2\0\n"s);
  InittabEditor inittab;
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab),
              ElementsAre(Entry{"al", "2", "respawn", "/bin/al"},
                          Entry{"be", "", "once", "/bin/beta"}, Entry{"de", "2", "", ""}));
  EXPECT_EQ(std::string(headOf(inittab)->id, 5), "al\0x\0"s);
}

TEST_F(EtcInittabTest, LongLinesComeInPiecesOf1023Characters) {
  // The line after the blanks is cut at the boundary, or begins after it.
  const std::string line = "al:2:respawn:/bin/alpha";
  for (size_t in_first = 0; in_first <= line.size(); ++in_first) {
    SCOPED_TRACE(in_first);
    std::vector<Entry> expected;
    // Each piece as a separate file: short lines are tested above.
    for (const std::string& piece : {line.substr(0, in_first), line.substr(in_first) + "\n"}) {
      for (const Entry& entry : loaded(piece)) expected.push_back(entry);
    }
    expected.push_back(kBeta);
    EXPECT_EQ(loaded(std::string(1023 - in_first, ' ') + line + "\n" + beta_line), expected);
  }
}

TEST_F(EtcInittabTest, LineWithoutAColonOf1023CharactersFillsAllFields) {
  const auto x = [](size_t length) { return std::string(length, 'x'); };
  const Entry full = {x(10), x(10), x(30), x(256)};
  for (const bool has_newline : {true, false}) {
    const std::string end = has_newline ? "\n" + gamma_line : "";
    const std::vector<Entry> rest = has_newline ? std::vector{kGamma} : std::vector<Entry>();
    for (const size_t length : {1022U, 1023U}) {
      SCOPED_TRACE(length);
      std::vector<Entry> expected = {full};
      expected.insert(expected.end(), rest.begin(), rest.end());
      EXPECT_EQ(loaded(x(length) + end), expected);
    }
    // Every further 1,023 characters are a line of their own.
    std::vector<Entry> expected = {full, {has_newline ? "x\n" : "x", "", "", ""}};
    expected.insert(expected.end(), rest.begin(), rest.end());
    EXPECT_EQ(loaded(x(1024) + end), expected);
    expected = {full, full, full, full, full};
    expected.insert(expected.end(), rest.begin(), rest.end());
    EXPECT_EQ(loaded(x(5000) + end), expected);
  }
}

TEST_F(EtcInittabTest, FieldsEndWhereAPieceEnds) {
  // Leading blanks move the end of the piece into each field in turn.
  const struct {
    const char* tail;
    Entry entry;
  } cases[] = {
      {"abcdefgh", {"abcdefgh", "", "", ""}},
      {"abcdefghij", {"abcdefghij", "", "", ""}},
      {"ab:", {"ab", "", "", ""}},
      {"ab:2", {"ab", "2", "", ""}},
      {"ab:2:", {"ab", "2", "", ""}},
      {"ab:2:once", {"ab", "2", "once", ""}},
      {"ab:2:once:", {"ab", "2", "once", ""}},
      {"ab:2:once:c", {"ab", "2", "once", "c"}},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.tail);
    // A piece that begins with ":" is not an entry.
    EXPECT_THAT(loaded(std::string(1023 - strlen(with.tail), ' ') + with.tail + ":more\n"),
                ElementsAre(with.entry));
  }
}

TEST_F(EtcInittabTest, LoadsManyLinesInOrder) {
  constexpr int kLines = 100000;
  std::string contents;
  for (int i = 0; i < kLines; ++i) {
    const std::string id = "s" + std::to_string(i);
    contents += lineOf({id, "2", "respawn", "/bin/" + id});
  }

  const std::vector<Entry> list = loaded(contents);

  ASSERT_EQ(list.size(), static_cast<size_t>(kLines));
  for (int i = 0; i < kLines; ++i) {
    const std::string id = "s" + std::to_string(i);
    ASSERT_EQ(list[static_cast<size_t>(i)], (Entry{id, "2", "respawn", "/bin/" + id}));
  }
}

}  // namespace
