#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <type_traits>
#include <vector>

#include "editors.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

// ---- Fixture ----

class EtcInittabTest : public EditorTest<InittabEditor>, protected InittabTraits {
 protected:
  ~EtcInittabTest() override { EtcInittab::ETC_INITTAB_PREFIX_ID = original_prefix_; }

 private:
  const char* const original_prefix_ = EtcInittab::ETC_INITTAB_PREFIX_ID;
};

// ---- Constants and layout ----

TEST(EtcInittabClass, HasItsPublishedConstants) {
  static_assert(std::is_same_v<decltype(EtcInittab::ETC_INITTAB_FILE), const char*>);
  static_assert(std::is_same_v<decltype(EtcInittab::ETC_INITTAB_FILE_BACKUP), const char*>);
  static_assert(std::is_same_v<decltype(EtcInittab::ETC_INITTAB_PREFIX_ID), const char*>);
  EXPECT_STREQ(EtcInittab::ETC_INITTAB_FILE, "/etc/inittab");
  EXPECT_STREQ(EtcInittab::ETC_INITTAB_FILE_BACKUP, "/etc/inittab.vrasave");
  EXPECT_STREQ(EtcInittab::ETC_INITTAB_PREFIX_ID, "vra");
}

TEST(EtcInittabClass, KeepsTheLayoutThatClientsWereCompiledWith) {
  static_assert(sizeof(InittabEntry::id) == 10);
  static_assert(sizeof(InittabEntry::runlevels) == 10);
  static_assert(sizeof(InittabEntry::action) == 30);
  static_assert(sizeof(InittabEntry::process) >= 257);
  static_assert(offsetof(InittabEntry, id) == 0);
  static_assert(offsetof(InittabEntry, runlevels) == 10);
  static_assert(offsetof(InittabEntry, action) == 20);
  static_assert(offsetof(InittabEntry, process) == 50);
  static_assert(offsetof(InittabEntry, next) == sizeof(InittabEntry) - sizeof(void*));
  static_assert(std::is_polymorphic_v<EtcInittab>);
  static_assert(std::has_virtual_destructor_v<EtcInittab>);
  static_assert(!std::is_copy_constructible_v<EtcInittab>);
  static_assert(sizeof(EtcInittab) == 24);

  const EtcInittab inittab;
  EXPECT_STREQ(fieldAt<const char*>(inittab, 8), "/etc/inittab");
  EXPECT_NE(fieldAt<const char*>(inittab, 8), EtcInittab::ETC_INITTAB_FILE) << "a copy";
  EXPECT_EQ(headOf(inittab), nullptr);
}

TEST_F(EtcInittabTest, FieldsArePathAndList) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(fieldAt<const char*>(inittab, 8), path);
  EXPECT_EQ(headOf(inittab), inittab.getInittabEntry("al"));
}

TEST_F(EtcInittabTest, EveryMemberFunctionHasItsOwnIdAndClass) {
  writeFile(path, alpha_line);
  Records records(kEntryExit33 | kEntryExit43);
  const auto idsOf = [&](const auto& action) {
    records.clear();
    action();
    std::vector<uint64_t> ids;
    for (const Record& record : records.all()) {
      const uint64_t trace_class = (record.id >> 8 & 0xFF) >= 9 ? 43 : 33;
      if ((record.id >> 16) != 0x3E07) continue;  // of another family
      EXPECT_EQ(record.type, 0x3000000 | ((trace_class - (record.hasData ? 0 : 1)) << 16));
      if (!record.hasData) ids.push_back(record.id);
    }
    return ids;
  };

  std::optional<InittabEditor> inittab;
  EXPECT_THAT(idsOf([&] { inittab.emplace(); }), ElementsAre(0x3E070100));
  EXPECT_THAT(idsOf([&] { inittab->readInittab(); }), ElementsAre(0x3E070300, 0x3E070C00));
  EXPECT_THAT(idsOf([&] { inittab->addInittabEntry(nullptr, "", "", ""); }),
              ElementsAre(0x3E070400));
  EXPECT_THAT(idsOf([&] { inittab->deleteInittabEntry(nullptr); }), ElementsAre(0x3E070500));
  EXPECT_THAT(idsOf([&] { inittab->doesInittabEntryExist("a"); }),
              ElementsAre(0x3E070600, 0x3E070900));
  EXPECT_THAT(idsOf([&] { inittab->isCommandRegistered("a"); }),
              ElementsAre(0x3E070700, 0x3E070A00));
  EXPECT_THAT(idsOf([&] { free(inittab->findAvaliableID()); }),
              ElementsAre(0x3E070800, 0x3E070600, 0x3E070900));
  EXPECT_THAT(idsOf([&] { free(inittab->getEntryInitIDWithCommand("a")); }),
              ElementsAre(0x3E070B00, 0x3E070A00));
  EXPECT_THAT(idsOf([&] { inittab.reset(); }), ElementsAre(0x3E070200, 0x3E070C00));
}

TEST_F(EtcInittabTest, SearchesAndFreeHaveAMaskBitOfTheirOwn) {
  writeFile(path, alpha_line);
  const Records records(kEntryExit43 | kExitError43);
  InittabEditor inittab;
  inittab.readInittab();
  EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
  EXPECT_TRUE(inittab.isCommandRegistered("alpha"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("alpha")), "al");

  EXPECT_THAT(records.trail(),
              ElementsAreArray(
                  kFreed + member("getInittabEntry", 0) + member("getInittabEntryWithCommand", 0) +
                  member("getEntryInitIDWithCommand", 0, member("getInittabEntryWithCommand", 0))));
}

// ---- Questions ----

TEST_F(EtcInittabTest, WithoutLoadingEveryIdAndCommandIsAbsent) {
  writeFile(path, "vra0:2:respawn:/bin/alpha\n");
  InittabEditor inittab;

  EXPECT_FALSE(inittab.doesInittabEntryExist("vra0"));
  EXPECT_FALSE(inittab.isCommandRegistered("/bin/alpha"));
  EXPECT_EQ(inittab.getInittabEntry("vra0"), nullptr);
  EXPECT_EQ(inittab.getInittabEntryWithCommand("/bin/alpha"), nullptr);
  EXPECT_EQ(inittab.getEntryInitIDWithCommand("/bin/alpha"), nullptr);
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra0");
  EXPECT_EQ(inittab.deleteInittabEntry("vra0"), OSUTILS_NO_SUCH_OBJECT);
}

TEST_F(EtcInittabTest, QuestionsWithANullPointerSayWhichFunctionWasAsked) {
  InittabEditor inittab;
  Records records;
  const auto refused = [&](const std::string& name, int code) {
    const Trail trail = records.trail();
    records.clear();
    EXPECT_EQ(trail, member(name, code, {"D EtcInittab: " + name + ": passed a null pointer.\n"}));
  };

  EXPECT_EQ(inittab.getInittabEntry(nullptr), nullptr);
  refused("getInittabEntry", 0);
  EXPECT_FALSE(inittab.doesInittabEntryExist(nullptr));
  refused("doesInittabEntryExist", 0);
  EXPECT_EQ(inittab.getInittabEntryWithCommand(nullptr), nullptr);
  refused("getInittabEntryWithCommand", 0);
  EXPECT_FALSE(inittab.isCommandRegistered(nullptr));
  refused("isCommandRegistered", 0);
  EXPECT_EQ(inittab.getEntryInitIDWithCommand(nullptr), nullptr);
  refused("getEntryInitIDWithCommand", 0);
  EXPECT_EQ(inittab.deleteInittabEntry(nullptr), OSUTILS_PARAM_ERROR);
  refused("deleteInittabEntry", 89);
  for (const int null_argument : {0, 1, 2, 3}) {
    SCOPED_TRACE(null_argument);
    const char* arguments[] = {"al", "2", "respawn", "/bin/alpha"};
    arguments[null_argument] = nullptr;
    EXPECT_EQ(inittab.addInittabEntry(arguments[0], arguments[1], arguments[2], arguments[3]),
              OSUTILS_PARAM_ERROR);
    refused("addInittabEntry", 89);
  }
}

TEST_F(EtcInittabTest, NullPointerIsRefusedBeforeAListedId) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.addInittabEntry("al", "2", "respawn", nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(contentsOf(path), alpha_line);
}

TEST_F(EtcInittabTest, IdsAreComparedExactly) {
  writeFile(path, "Alpha:2:respawn:/a\nalphabet:2:respawn:/b\nalpha :2:respawn:/c\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_TRUE(inittab.doesInittabEntryExist("Alpha"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("alpha "));
  for (const char* const other : {"alpha", "ALPHA", "Alph", "Alpha ", "", "alphabe", "Alpha:"}) {
    EXPECT_FALSE(inittab.doesInittabEntryExist(other)) << other;
    EXPECT_EQ(inittab.getInittabEntry(other), nullptr) << other;
  }
}

TEST_F(EtcInittabTest, FirstRecordOfAnIdAnswers) {
  writeFile(path, alpha_line + "al:3:once:/bin/other\n");
  InittabEditor inittab;
  inittab.readInittab();
  const Records records;

  const InittabEntry* const entry = inittab.getInittabEntry("al");

  ASSERT_NE(entry, nullptr);
  EXPECT_EQ(entry, headOf(inittab));
  EXPECT_EQ(entryOf(*entry), kAlpha);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("getInittabEntry", 0)));
}

TEST_F(EtcInittabTest, CommandIsFoundByAnyPartOfIt) {
  writeFile(path, "al:2:respawn:/opt/server/bin/start -f /etc/al.conf:x\nbe:2:once:/bin/beta\n");
  InittabEditor inittab;
  inittab.readInittab();

  for (const char* const part : {"/opt/server/bin/start -f /etc/al.conf:x", "server/bin", "/opt",
                                 "al.conf:x", " -f ", "x", "/bin/beta", "eta"}) {
    EXPECT_TRUE(inittab.isCommandRegistered(part)) << part;
  }
  // Not found in the other fields, nor across two of them.
  for (const char* const other : {"respawn", "respawn:/opt", "2:", "Server", "/opt/server/bin/stop",
                                  "/bin/betas", "xbe", "once"}) {
    EXPECT_FALSE(inittab.isCommandRegistered(other)) << other;
  }
}

TEST_F(EtcInittabTest, FirstRecordWithACommandAnswers) {
  writeFile(path, "al:2:respawn:/bin/one\nbe:2:once:/bin/two\nga:2:off:/bin/two three\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.getInittabEntryWithCommand("two"), headOf(inittab)->next);
  EXPECT_EQ(inittab.getInittabEntryWithCommand("three"), headOf(inittab)->next->next);
  EXPECT_EQ(inittab.getInittabEntryWithCommand(""), headOf(inittab)) << "a part of every command";
  EXPECT_EQ(inittab.getInittabEntryWithCommand("four"), nullptr);
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("two")), "be");
}

TEST_F(EtcInittabTest, CommandQuestionsLeaveTheirRecords) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  const Trail search = member("getInittabEntryWithCommand", 0);
  Records records;

  EXPECT_TRUE(inittab.isCommandRegistered("alpha"));
  EXPECT_THAT(records.trail(), ElementsAreArray(member("isCommandRegistered", 1, search)));
  records.clear();
  EXPECT_FALSE(inittab.isCommandRegistered("beta"));
  EXPECT_THAT(records.trail(), ElementsAreArray(member("isCommandRegistered", 0, search)));
  records.clear();
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("alpha")), "al");
  EXPECT_THAT(records.trail(), ElementsAreArray(member("getEntryInitIDWithCommand", 0, search)));
  records.clear();
  EXPECT_EQ(inittab.getEntryInitIDWithCommand("beta"), nullptr);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member(
                  "getEntryInitIDWithCommand", 0,
                  search + Trail{"D EtcInittab: getEntryInitIDWithCommand: No entry found.\n"})));
}

TEST_F(EtcInittabTest, IdOfACommandBelongsToTheCaller) {
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  const LiveAllocations memory;

  char* const id = inittab.getEntryInitIDWithCommand("alpha");

  EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
  inittab.freeInittabEntries();
  EXPECT_EQ(taken(id), "al");
  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcInittabTest, IdOfACommandIsNullWithoutAWordWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, alpha_line);
  InittabEditor inittab;
  inittab.readInittab();
  const Records records;
  const FailingCall copy(Call::strdup, ENOMEM);

  EXPECT_EQ(inittab.getEntryInitIDWithCommand("alpha"), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_THAT(records.trail(), ElementsAreArray(member("getEntryInitIDWithCommand", 0,
                                                       member("getInittabEntryWithCommand", 0))));
}

// ---- A free id ----

const std::string kSuffixes = "0123456789abcdefghijklmnopqrstuvwxyz";

std::string lineFor(const std::string& id) { return id + ":2:respawn:/bin/" + id + "\n"; }

TEST_F(EtcInittabTest, FreeIdsAreProposedInTheOrderOfDigitsAndThenLetters) {
  writeFile(path, "");
  InittabEditor inittab;
  for (const char suffix : kSuffixes) {
    const std::string id = taken(inittab.findAvaliableID());
    ASSERT_EQ(id, std::string("vra") + suffix);
    ASSERT_EQ(inittab.add({id, "2", "respawn", "/bin/x"}), OSUTILS_SUCCESS);
  }
  const Records records;

  EXPECT_EQ(inittab.findAvaliableID(), nullptr);

  Trail candidates;
  for (size_t i = 0; i < kSuffixes.size(); ++i) candidates = candidates + kListed;
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member(
          "findAvaliableID", 0,
          candidates + Trail{"D EtcInittab::findAvaliableID did not find avaliable id.\n"})));
}

TEST_F(EtcInittabTest, FirstGapIsProposed) {
  std::string digits;
  for (char digit = '0'; digit <= '9'; ++digit) digits += lineFor(std::string("vra") + digit);
  const struct {
    std::string contents;
    const char* free_id;
  } cases[] = {
      {"", "vra0"},
      {lineFor("vra1"), "vra0"},
      {lineFor("vra0"), "vra1"},
      {digits, "vraa"},
      {digits + lineFor("vraA") + lineFor("vrab"), "vraa"},
      {digits + lineFor("vraa"), "vrab"},
      {lineFor("VRA0") + lineFor("vra") + lineFor("vra00") + lineFor("vra0 "), "vra0"},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.contents);
    fill(with.contents);
    InittabEditor inittab;
    inittab.readInittab();
    EXPECT_EQ(taken(inittab.findAvaliableID()), with.free_id);
  }
}

TEST_F(EtcInittabTest, UpperCaseIdsAreNeitherProposedNorTaken) {
  std::string lower;
  std::string upper;
  for (const char suffix : kSuffixes) {
    lower += lineFor(std::string("vra") + suffix);
    upper += lineFor(std::string("vra") + static_cast<char>(toupper(suffix)));
  }
  fill(upper);
  InittabEditor inittab;
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vraa") << "the digits are taken";

  fill(lower);
  inittab.readInittab();
  EXPECT_EQ(inittab.findAvaliableID(), nullptr);

  fill(lower.substr(0, lower.rfind("\nvraz") + 1) + upper);
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vraz");
}

TEST_F(EtcInittabTest, FreeIdBelongsToTheCallerAndTakenOnesAreFreed) {
  writeFile(path, lineFor("vra0") + lineFor("vra1"));
  InittabEditor inittab;
  inittab.readInittab();
  const LiveAllocations memory;
  const Records records;

  char* const id = inittab.findAvaliableID();

  EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("findAvaliableID", 0, kListed + kListed + kNotListed)));
  EXPECT_EQ(taken(id), "vra2");
  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcInittabTest, ThereIsNothingToFreeWhenAllIdsAreTaken) {
  std::string all;
  for (const char suffix : kSuffixes) all += lineFor(std::string("vra") + suffix);
  writeFile(path, all);
  InittabEditor inittab;
  inittab.readInittab();
  const LiveAllocations memory;

  EXPECT_EQ(inittab.findAvaliableID(), nullptr);

  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcInittabTest, PrefixIsReadAtEachCall) {
  writeFile(path, lineFor("vra0") + lineFor("xy0"));
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra1");
  EtcInittab::ETC_INITTAB_PREFIX_ID = "xy";
  EXPECT_EQ(taken(inittab.findAvaliableID()), "xy1");
  EtcInittab::ETC_INITTAB_PREFIX_ID = "";
  EXPECT_EQ(taken(inittab.findAvaliableID()), "0");
  const std::string endless(5000, 'p');
  EtcInittab::ETC_INITTAB_PREFIX_ID = endless.c_str();
  EXPECT_EQ(taken(inittab.findAvaliableID()), endless + "0");
}

TEST_F(EtcInittabTest, CandidateThatCannotBeMadeIsPassedOver) {
  writeFile(path, lineFor("vra0") + lineFor("vra1"));
  InittabEditor inittab;
  const struct {
    int nth;
    const char* free_id;
  } cases[] = {{1, "vra2"}, {2, "vra2"}, {3, "vra3"}, {4, "vra2"}};
  inittab.readInittab();
  for (const auto& with : cases) {
    SCOPED_TRACE(with.nth);
    const LiveAllocations memory;
    const FailingCall print(Call::vra_asprintf, ENOMEM, with.nth);

    EXPECT_EQ(taken(inittab.findAvaliableID()), with.free_id);

    EXPECT_EQ(print.fired(), with.nth != 4);
    EXPECT_EQ(memory.blocks(), 0);
  }
}

TEST_F(EtcInittabTest, WithoutMemoryForAnyCandidateNoneIsFound) {
  InittabEditor inittab;
  const Records records;
  const FailingCall print(Call::vra_asprintf, ENOMEM, 1, INT_MAX);

  EXPECT_EQ(inittab.findAvaliableID(), nullptr);

  EXPECT_EQ(print.calls(), 36);
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member("findAvaliableID", 0,
                              {"D EtcInittab::findAvaliableID did not find avaliable id.\n"})));
}

// ---- Loading ----

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

// Of a line with too few fields the last one has the newline, as the text has that a deletion
// compares with an id: both take the line for the same.
TEST_F(EtcInittabTest, FieldsThatALineDoesNotHaveAreEmpty) {
  // The first line is long, so that something would be there to run into.
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
  // The newline is the rest of the field, which begins the next one.
  EXPECT_THAT(loaded(x(10) + "\n" + gamma_line), ElementsAre(Entry{x(10), "\n", "", ""}, kGamma));
  EXPECT_THAT(loaded(x(20) + "\n" + gamma_line),
              ElementsAre(Entry{x(10), x(10), "\n", ""}, kGamma));
  EXPECT_THAT(loaded(x(9) + "\n" + gamma_line),
              ElementsAre(Entry{x(9) + "\n", "", "", ""}, kGamma));
}

TEST_F(EtcInittabTest, RecordIsZeroBehindEachValue) {
  fill("x0123456789:xx:yyy:" + std::string(300, 'z') + "\nal:2:respawn:/bin/alpha\n");
  InittabEditor inittab;
  inittab.readInittab();
  inittab.freeInittabEntries();  // memory that a new record may get again
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

// What fills its array reads on, as the programs that use these records expect.
TEST_F(EtcInittabTest, FullIdIsReadTogetherWithTheRunLevels) {
  fill("abcdefghij:2:once:/bin/full\n");
  InittabEditor inittab;
  inittab.readInittab();

  EXPECT_FALSE(inittab.doesInittabEntryExist("abcdefghij"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("abcdefghij2"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("full")), "abcdefghij2");
  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij"), OSUTILS_NO_SUCH_OBJECT);

  // Found by what the record says, but no line begins so.
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

// Where the id ends with an array, the next one follows without a NUL between them; from 50 on the
// colon behind the id is part of the command.
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
  EXPECT_EQ(taken(inittab.findAvaliableID()), "prefix-of0") << "the record says prefix-of02";
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
  // The line behind the blanks is cut at the border, or begins behind it.
  const std::string line = "al:2:respawn:/bin/alpha";
  for (size_t in_first = 0; in_first <= line.size(); ++in_first) {
    SCOPED_TRACE(in_first);
    std::vector<Entry> expected;
    // Each piece as a file of its own: short lines have tests above.
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
    // One more character is a line of its own, and so is what is behind 4,092.
    std::vector<Entry> expected = {full, {has_newline ? "x\n" : "x", "", "", ""}};
    expected.insert(expected.end(), rest.begin(), rest.end());
    EXPECT_EQ(loaded(x(1024) + end), expected);
    expected = {full, full, full, full, full};
    expected.insert(expected.end(), rest.begin(), rest.end());
    EXPECT_EQ(loaded(x(5000) + end), expected);
  }
}

TEST_F(EtcInittabTest, FieldsEndWhereAPieceEnds) {
  // Leading blanks put the last character of the piece into each field in turn.
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
    // A piece that begins with a ":" is no entry.
    EXPECT_THAT(loaded(std::string(1023 - strlen(with.tail), ' ') + with.tail + ":more\n"),
                ElementsAre(with.entry));
  }
}

TEST_F(EtcInittabTest, LoadsManyLinesInOrder) {
  constexpr int kLines = 100000;
  std::string contents;
  for (int i = 0; i < kLines; ++i) contents += lineFor("s" + std::to_string(i));

  const std::vector<Entry> list = loaded(contents);

  ASSERT_EQ(list.size(), static_cast<size_t>(kLines));
  for (int i = 0; i < kLines; ++i) {
    const std::string id = "s" + std::to_string(i);
    ASSERT_EQ(list[static_cast<size_t>(i)], (Entry{id, "2", "respawn", "/bin/" + id}));
  }
}

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

// The record that the id belongs to is freed on the way.
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

TEST_F(EtcInittabTest, DeleteKeepsTheLineOfAnIdThatIsNoneInTheFile) {
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

  // The second piece goes with its newline: the first one is joined by the next line.
  const std::string blanks(1023, ' ');
  EXPECT_EQ(without("al", blanks + alpha_line + beta_line), blanks + beta_line);
  // A whole piece has no newline, so the id alone is enough, as at the end of the file.
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

// ---- The system's own file ----

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

// ---- Any file ----

const std::string kSpace = " \t\n\v\f\r";

const std::string kFirst = "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";

// The piece from the first character of its entry on; empty when it has none.
std::string entryText(const std::string& piece) {
  const size_t begin = piece.find_first_not_of(kSpace);
  if (begin == std::string::npos || kFirst.find(piece[begin]) == std::string::npos) return "";
  return piece.substr(begin);
}

std::string upToNul(const std::string& text) { return text.substr(0, text.find('\0')); }

// Takes the field from the text's beginning.
std::string takeField(std::string& text, size_t width) {
  const size_t length = std::min({text.find(':'), width, text.size()});
  const std::string field = text.substr(0, length);
  text.erase(0, length);
  if (!text.empty() && text[0] == ':') text.erase(0, 1);
  return field;
}

// A record as the library must lay it out: everything that is not a field is zero.
std::string modelRecord(std::string text) {
  std::string record;
  for (const size_t width : {10U, 10U, 30U}) {
    std::string field = takeField(text, width);
    field.resize(width);
    record += field;
  }
  text = upToNul(text.substr(0, text.find('\n'))).substr(0, 256);
  text.resize(sizeof(InittabEntry::process));
  return record + text;
}

std::vector<std::string> modelList(const std::string& contents) {
  std::vector<std::string> list;
  for (const std::string& piece : piecesOf(contents)) {
    const std::string text = entryText(piece);
    if (!text.empty()) list.push_back(modelRecord(text));
  }
  return list;
}

std::string modelDelete(const std::string& id, const std::string& contents) {
  std::string left;
  for (const std::string& piece : piecesOf(contents)) {
    const std::string text = entryText(piece);
    if (text.empty() || upToNul(text.substr(0, text.find(':'))) != id) left += piece;
  }
  return left;
}

std::vector<std::string> recordsOf(const EtcInittab& inittab) {
  std::vector<std::string> list;
  for (const InittabEntry* entry = headOf(inittab); entry != nullptr; entry = entry->next) {
    list.emplace_back(reinterpret_cast<const char*>(entry),
                      offsetof(InittabEntry, process) + sizeof entry->process);
  }
  return list;
}

class RandomFile {
 public:
  explicit RandomFile(unsigned int seed) : random_(seed) {}

  size_t below(size_t limit) { return random_() % limit; }

  std::string contents() {
    std::string made;
    const size_t parts = below(60) + (below(20) == 0 ? 3000 : 0);
    for (size_t i = 0; i < parts; ++i) made += part();
    return made;
  }

 private:
  std::string part() {
    using namespace std::string_literals;
    static const std::string alphabet = "ab1#:: \t\r\v\n\0-_.+0\x80\xFF"s;
    switch (below(12)) {
      case 0:
      case 1:
        return id() + ":2345:respawn:/bin/" + id() + " -x:y\n";
      case 2:
        return "  " + id() + ":" + std::string(below(12), '3') + ":once:" + id() + "\n";
      case 3:
        return "\n";
      case 4:
        // About as long as a piece, or as a field.
        switch (below(8)) {
          case 0:
            return std::string(1010 + below(30), "ab:#\v"[below(5)]);
          case 1:
            return std::string(8 + below(4), 'x') + ":";
          case 2:
            return std::string(28 + below(4), 'y') + ":";
          case 3:
            return std::string(250 + below(12), 'z');
          default:
            return id();
        }
      case 5:
        return id() + ":";
      default:
        return std::string(1, alphabet[below(alphabet.size())]);
    }
  }

  // Few, so that they repeat.
  std::string id() { return std::string(1 + below(2), "ab1"[below(3)]); }

  std::mt19937 random_;
};

constexpr unsigned int kFiles = 2000;

TEST_F(EtcInittabTest, LoadsFromAnyFileWhatAPlainParserFinds) {
  size_t entries_seen = 0;
  for (unsigned int seed = 1; seed <= kFiles; ++seed) {
    SCOPED_TRACE(seed);
    const std::string contents = RandomFile(seed).contents();
    fill(contents);
    InittabEditor inittab;
    ASSERT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    const std::vector<std::string> list = recordsOf(inittab);
    ASSERT_EQ(list, modelList(contents));
    entries_seen += list.size();
  }
  EXPECT_GT(entries_seen, kFiles) << "otherwise this says little";
}

TEST_F(EtcInittabTest, DeletesFromAnyFileTheLinesOfThatId) {
  size_t shortened = 0;
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents();
    const std::vector<std::string> list = modelList(contents);
    if (list.empty()) continue;
    // As a string it ends at the first NUL of the record.
    const std::string id = upToNul(list[random.below(list.size())]);
    const std::string left = without(id, contents);
    ASSERT_EQ(left, modelDelete(id, contents));
    if (left.size() < contents.size()) ++shortened;
  }
  EXPECT_GT(shortened, kFiles / 20);
}

TEST_F(EtcInittabTest, AddingAndDeletingANewEntryLeavesAFinishedFileAsItWas) {
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents() + "\n";
    writeFile(path, contents);
    InittabEditor inittab;
    ASSERT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    const std::vector<std::string> before = recordsOf(inittab);
    const std::string id = taken(inittab.findAvaliableID());
    const std::string command = "/bin/" + std::string(random.below(300), 'n');

    ASSERT_EQ(inittab.add({id, "2345", "respawn", command}), OSUTILS_SUCCESS);
    ASSERT_EQ(contentsOf(path), contents + id + ":2345:respawn:" + command + "\n");
    ASSERT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS);

    ASSERT_EQ(contentsOf(path), contents);
    ASSERT_EQ(recordsOf(inittab), before);
  }
}

}  // namespace
