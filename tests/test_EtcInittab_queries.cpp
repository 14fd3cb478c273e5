// EtcInittab: layout, queries and the search for a free id.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <stddef.h>
#include <stdlib.h>

#include <optional>
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
using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

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
  EXPECT_NE(fieldAt<const char*>(inittab, 8), EtcInittab::ETC_INITTAB_FILE) << "not copied";
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

// ---- Queries ----

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
  // Only the command is searched.
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
  EXPECT_EQ(inittab.getInittabEntryWithCommand(""), headOf(inittab)) << "every command contains it";
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

// ---- Free id ----

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

}  // namespace
