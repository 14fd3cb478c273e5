#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#include "cancelled.h"
#include "faults.h"
#include "osutils.h"
#include "power_failure.h"
#include "records.h"
#include "small_stack.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

// ---- What is compared ----

struct Entry {
  std::string id;
  std::string runlevels;
  std::string action;
  std::string process;
  bool operator==(const Entry&) const = default;
};

void PrintTo(const Entry& entry, std::ostream* out) {
  *out << "\"" << entry.id << "\" \"" << entry.runlevels << "\" \"" << entry.action << "\" \""
       << entry.process << "\"";
}

// The value in the array: up to its NUL, or all of it.
template <size_t Size>
std::string valueOf(const char (&field)[Size]) {
  return std::string(field, strnlen(field, Size));
}

Entry entryOf(const InittabEntry& entry) {
  return {valueOf(entry.id), valueOf(entry.runlevels), valueOf(entry.action),
          valueOf(entry.process)};
}

// The field at this offset of the object; what it is has a test of its own below.
template <typename Field>
Field fieldAt(const EtcInittab& inittab, size_t offset) {
  Field field;
  memcpy(&field, reinterpret_cast<const char*>(&inittab) + offset, sizeof field);
  return field;
}

const InittabEntry* headOf(const EtcInittab& inittab) {
  return fieldAt<const InittabEntry*>(inittab, 16);
}

std::vector<Entry> listOf(const EtcInittab& inittab) {
  std::vector<Entry> list;
  for (const InittabEntry* entry = headOf(inittab); entry != nullptr; entry = entry->next) {
    list.push_back(entryOf(*entry));
  }
  return list;
}

// The string, freed.
std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

const Entry kAlpha = {"al", "2", "respawn", "/bin/alpha"};
const Entry kBeta = {"be", "35", "once", "/bin/beta -x"};
const Entry kGamma = {"ga", "", "off", "/bin/gamma"};
const std::string kAlphaLine = "al:2:respawn:/bin/alpha\n";
const std::string kBetaLine = "be:35:once:/bin/beta -x\n";
const std::string kGammaLine = "ga::off:/bin/gamma\n";

Trail member(const std::string& name, int code, const Trail& inside = {}) {
  return call("EtcInittab::" + name, code, inside);
}

const Trail kFreed = member("freeInittabEntries", 0);
const Trail kListed = member("doesInittabEntryExist", 1, member("getInittabEntry", 0));
const Trail kNotListed = member("doesInittabEntryExist", 0, member("getInittabEntry", 0));

// ---- Where it happens ----

// Points the class at files of the test's own, and back again.
class EtcInittabTest : public testing::Test {
 protected:
  EtcInittabTest() : mask_(umask(022)) { pointAt(path, backup); }
  ~EtcInittabTest() override {
    EtcInittab::ETC_INITTAB_FILE = original_;
    EtcInittab::ETC_INITTAB_FILE_BACKUP = original_backup_;
    EtcInittab::ETC_INITTAB_PREFIX_ID = original_prefix_;
    umask(mask_);
  }

  static void pointAt(const std::string& inittab, const std::string& copy) {
    EtcInittab::ETC_INITTAB_FILE = inittab.c_str();
    EtcInittab::ETC_INITTAB_FILE_BACKUP = copy.c_str();
  }

  void fill(const std::string& contents) const {
    unlink(path.c_str());  // some file systems wait for the disk when a file is written over
    writeFile(path, contents);
  }

  // What is loaded from a file with these contents.
  std::vector<Entry> loaded(const std::string& contents) const {
    fill(contents);
    EtcInittab inittab;
    EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    return listOf(inittab);
  }

  // What a file with these contents holds after the deletion.
  std::string without(const std::string& id, const std::string& contents) const {
    fill(contents);
    EtcInittab inittab;
    EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS) << id;
    EXPECT_FALSE(pathExists(backup));
    return contentsOf(path);
  }

  const TempDir temp;
  std::string path = temp.path("inittab");
  std::string backup = temp.path("inittab.save");

 private:
  const char* const original_ = EtcInittab::ETC_INITTAB_FILE;
  const char* const original_backup_ = EtcInittab::ETC_INITTAB_FILE_BACKUP;
  const char* const original_prefix_ = EtcInittab::ETC_INITTAB_PREFIX_ID;
  const mode_t mask_;
};

int add(EtcInittab& inittab, const Entry& entry) {
  return inittab.addInittabEntry(entry.id.c_str(), entry.runlevels.c_str(), entry.action.c_str(),
                                 entry.process.c_str());
}

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
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(fieldAt<const char*>(inittab, 8), path);
  EXPECT_EQ(headOf(inittab), inittab.getInittabEntry("al"));
}

TEST_F(EtcInittabTest, EveryMemberFunctionHasItsOwnIdAndClass) {
  writeFile(path, kAlphaLine);
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

  std::optional<EtcInittab> inittab;
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
  writeFile(path, kAlphaLine);
  const Records records(kEntryExit43 | kExitError43);
  EtcInittab inittab;
  inittab.readInittab();
  EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
  EXPECT_TRUE(inittab.isCommandRegistered("alpha"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("alpha")), "al");

  EXPECT_THAT(records.trail(),
              ElementsAreArray(
                  kFreed + member("getInittabEntry", 0) + member("getInittabEntryWithCommand", 0) +
                  member("getEntryInitIDWithCommand", 0, member("getInittabEntryWithCommand", 0))));
}

// ---- Construction and destruction ----

TEST_F(EtcInittabTest, ConstructorReadsNoFile) {
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall queries(Call::stat64, 0, kNever);
  const Records records;

  const EtcInittab inittab;

  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(opens.calls() + queries.calls(), 0);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("EtcInittab", 0)));
}

TEST_F(EtcInittabTest, PathIsTheOneThatWasSetAtConstruction) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  const std::string other = temp.file("other", kBetaLine);
  EtcInittab::ETC_INITTAB_FILE = other.c_str();

  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
}

TEST_F(EtcInittabTest, DestructorFreesThePathAndTheList) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine + kBetaLine);
  const LiveAllocations memory;
  {
    EtcInittab inittab;
    EXPECT_EQ(memory.blocks(), 1);
    inittab.readInittab();
    EXPECT_EQ(add(inittab, kGamma), OSUTILS_SUCCESS);
    EXPECT_EQ(memory.blocks(), 4);
  }
  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcInittabTest, DestructorLeavesRecords) {
  std::optional<EtcInittab> inittab(std::in_place);
  const Records records;

  inittab.reset();

  EXPECT_THAT(records.trail(), ElementsAreArray(member("~EtcInittab", 0, kFreed)));
}

TEST_F(EtcInittabTest, WithoutItsPathEveryFileOperationIsAParameterError) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine);
  FailingCall copy(Call::strdup, ENOMEM);
  EtcInittab inittab;
  ASSERT_TRUE(copy.fired());
  const Trail refused =
      call("checkFilePerms", 89, Trail{"D checkFilePerms: passed a null pointer.\n"});

  {
    const Records records;
    EXPECT_EQ(inittab.readInittab(), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("readInittab", 89, kFreed + refused)));
  }
  {
    const Records records;
    EXPECT_EQ(add(inittab, kBeta), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("addInittabEntry", 89, kNotListed + refused)));
  }
  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_NO_SUCH_OBJECT) << "the list is empty";
  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(contentsOf(path), kAlphaLine);
}

// ---- Questions ----

TEST_F(EtcInittabTest, WithoutLoadingEveryIdAndCommandIsAbsent) {
  writeFile(path, "vra0:2:respawn:/bin/alpha\n");
  EtcInittab inittab;

  EXPECT_FALSE(inittab.doesInittabEntryExist("vra0"));
  EXPECT_FALSE(inittab.isCommandRegistered("/bin/alpha"));
  EXPECT_EQ(inittab.getInittabEntry("vra0"), nullptr);
  EXPECT_EQ(inittab.getInittabEntryWithCommand("/bin/alpha"), nullptr);
  EXPECT_EQ(inittab.getEntryInitIDWithCommand("/bin/alpha"), nullptr);
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra0");
  EXPECT_EQ(inittab.deleteInittabEntry("vra0"), OSUTILS_NO_SUCH_OBJECT);
}

TEST_F(EtcInittabTest, QuestionsWithANullPointerSayWhichFunctionWasAsked) {
  EtcInittab inittab;
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
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.addInittabEntry("al", "2", "respawn", nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(contentsOf(path), kAlphaLine);
}

TEST_F(EtcInittabTest, IdsAreComparedExactly) {
  writeFile(path, "Alpha:2:respawn:/a\nalphabet:2:respawn:/b\nalpha :2:respawn:/c\n");
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_TRUE(inittab.doesInittabEntryExist("Alpha"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("alpha "));
  for (const char* const other : {"alpha", "ALPHA", "Alph", "Alpha ", "", "alphabe", "Alpha:"}) {
    EXPECT_FALSE(inittab.doesInittabEntryExist(other)) << other;
    EXPECT_EQ(inittab.getInittabEntry(other), nullptr) << other;
  }
}

TEST_F(EtcInittabTest, FirstRecordOfAnIdAnswers) {
  writeFile(path, kAlphaLine + "al:3:once:/bin/other\n");
  EtcInittab inittab;
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
  EtcInittab inittab;
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
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.getInittabEntryWithCommand("two"), headOf(inittab)->next);
  EXPECT_EQ(inittab.getInittabEntryWithCommand("three"), headOf(inittab)->next->next);
  EXPECT_EQ(inittab.getInittabEntryWithCommand(""), headOf(inittab)) << "a part of every command";
  EXPECT_EQ(inittab.getInittabEntryWithCommand("four"), nullptr);
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("two")), "be");
}

TEST_F(EtcInittabTest, CommandQuestionsLeaveTheirRecords) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
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
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
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
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const Records records;
  const FailingCall copy(Call::strdup, ENOMEM);

  EXPECT_EQ(inittab.getEntryInitIDWithCommand("alpha"), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_THAT(records.trail(), ElementsAreArray(member("getEntryInitIDWithCommand", 0,
                                                       member("getInittabEntryWithCommand", 0))));
}

TEST_F(EtcInittabTest, FreeingEmptiesTheListAndMayBeRepeated) {
  writeFile(path, kAlphaLine + kBetaLine);
  EtcInittab inittab;
  inittab.readInittab();

  inittab.freeInittabEntries();
  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_FALSE(inittab.doesInittabEntryExist("al"));
  inittab.freeInittabEntries();
  EXPECT_THAT(listOf(inittab), IsEmpty());
}

// ---- A free id ----

const std::string kSuffixes = "0123456789abcdefghijklmnopqrstuvwxyz";

std::string lineFor(const std::string& id) { return id + ":2:respawn:/bin/" + id + "\n"; }

TEST_F(EtcInittabTest, FreeIdsAreProposedInTheOrderOfDigitsAndThenLetters) {
  writeFile(path, "");
  EtcInittab inittab;
  for (const char suffix : kSuffixes) {
    const std::string id = taken(inittab.findAvaliableID());
    ASSERT_EQ(id, std::string("vra") + suffix);
    ASSERT_EQ(add(inittab, {id, "2", "respawn", "/bin/x"}), OSUTILS_SUCCESS);
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
    EtcInittab inittab;
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
  EtcInittab inittab;
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
  EtcInittab inittab;
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
  EtcInittab inittab;
  inittab.readInittab();
  const LiveAllocations memory;

  EXPECT_EQ(inittab.findAvaliableID(), nullptr);

  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcInittabTest, PrefixIsReadAtEachCall) {
  writeFile(path, lineFor("vra0") + lineFor("xy0"));
  EtcInittab inittab;
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
  EtcInittab inittab;
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
  EtcInittab inittab;
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

TEST_F(EtcInittabTest, LoadsWithTheRecordsOfEachStep) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  const Records records;

  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(records.trail(), ElementsAreArray(member("readInittab", 0, kFreed + kGoodFile)));
}

TEST_F(EtcInittabTest, LoadingAgainReplacesTheList) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  writeFile(path, kBetaLine);

  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta));
}

TEST_F(EtcInittabTest, LoadsTheLastLineOnceWithOrWithoutItsNewline) {
  EXPECT_THAT(loaded(kAlphaLine + kBetaLine.substr(0, kBetaLine.size() - 1)),
              ElementsAre(kAlpha, kBeta));
  EXPECT_THAT(loaded(kAlphaLine), ElementsAre(kAlpha));
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
    EXPECT_THAT(loaded(before + with.line + "\n" + kGammaLine),
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
    EXPECT_THAT(loaded(with.line + "\n" + kGammaLine), ElementsAre(with.entry, kGamma));
    EXPECT_THAT(loaded(with.line), ElementsAre(with.entry));
  }
}

TEST_F(EtcInittabTest, FieldAsWideAsItsArrayMayEndTheLine) {
  const auto x = [](size_t length) { return std::string(length, 'x'); };
  EXPECT_THAT(loaded(x(10)), ElementsAre(Entry{x(10), "", "", ""}));
  EXPECT_THAT(loaded(x(20)), ElementsAre(Entry{x(10), x(10), "", ""}));
  // The newline is the rest of the field, which begins the next one.
  EXPECT_THAT(loaded(x(10) + "\n" + kGammaLine), ElementsAre(Entry{x(10), "\n", "", ""}, kGamma));
  EXPECT_THAT(loaded(x(20) + "\n" + kGammaLine),
              ElementsAre(Entry{x(10), x(10), "\n", ""}, kGamma));
  EXPECT_THAT(loaded(x(9) + "\n" + kGammaLine),
              ElementsAre(Entry{x(9) + "\n", "", "", ""}, kGamma));
}

TEST_F(EtcInittabTest, RecordIsZeroBehindEachValue) {
  fill("x0123456789:xx:yyy:" + std::string(300, 'z') + "\nal:2:respawn:/bin/alpha\n");
  EtcInittab inittab;
  inittab.readInittab();
  inittab.freeInittabEntries();  // memory that a new record may get again
  fill(kAlphaLine);
  inittab.readInittab();
  add(inittab, kBeta);

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
  EtcInittab inittab;
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
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij2"), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"abcdefghij", "3", "once", "/bin/three"}));
}

TEST_F(EtcInittabTest, FullIdEndsAtEmptyRunLevels) {
  fill("abcdefghij::once:/bin/full\n");
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("full")), "abcdefghij");
  EXPECT_EQ(inittab.deleteInittabEntry("abcdefghij"), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(contentsOf(path), "");
}

TEST_F(EtcInittabTest, LongIdOfALineIsWholeAgainWhenReadOn) {
  const std::string id = "abcdefghijklmno";
  fill(id + ":2:once:/bin/full\n" + kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  EXPECT_EQ(entryOf(*headOf(inittab)), (Entry{"abcdefghij", "klmno", "2", "once:/bin/full"}));

  EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_EQ(contentsOf(path), kAlphaLine);
}

// Where the id ends with an array, the next one follows without a NUL between them; from 50 on the
// colon behind the id is part of the command.
TEST_F(EtcInittabTest, LineGoesWithItsIdUnlessTheIdIsReadOnIntoTheNextField) {
  for (size_t length = 1; length <= 60; ++length) {
    SCOPED_TRACE(length);
    const std::string id(length, 'i');
    fill(id + ":2:once:/bin/long\n" + kAlphaLine);
    EtcInittab inittab;
    inittab.readInittab();
    const bool is_found = length != 10 && length != 20 && length < 50;

    const std::string id_of_first = taken(inittab.getEntryInitIDWithCommand(""));
    EXPECT_THAT(id_of_first, testing::StartsWith(id));
    EXPECT_EQ(id_of_first == id, is_found);
    EXPECT_EQ(inittab.doesInittabEntryExist(id.c_str()), is_found);
    EXPECT_EQ(inittab.deleteInittabEntry(id.c_str()),
              is_found ? OSUTILS_SUCCESS : OSUTILS_NO_SUCH_OBJECT);
    EXPECT_EQ(contentsOf(path) == kAlphaLine, is_found);
  }
}

TEST_F(EtcInittabTest, FullFieldsAreReadAsOneIdUpToTheEndOfTheCommand) {
  const std::string id(10, 'i');
  const std::string runlevels(10, 'r');
  const std::string action(30, 'a');
  fill(id + ":" + runlevels + ":" + action + ":" + std::string(300, 'c') + "\n");
  EtcInittab inittab;
  inittab.readInittab();
  const std::string whole = id + runlevels + action + std::string(256, 'c');

  EXPECT_TRUE(inittab.doesInittabEntryExist(whole.c_str()));
  EXPECT_FALSE(inittab.doesInittabEntryExist((id + runlevels + action).c_str()));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("ccc")), whole);
}

TEST_F(EtcInittabTest, FullIdWithRunLevelsIsNotTakenForAFreeOne) {
  EtcInittab::ETC_INITTAB_PREFIX_ID = "prefix-of";
  fill("prefix-of0:2:once:/a\n");
  EtcInittab inittab;
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "prefix-of0") << "the record says prefix-of02";
  fill("prefix-of0::once:/a\n");
  inittab.readInittab();
  EXPECT_EQ(taken(inittab.findAvaliableID()), "prefix-of1");
}

TEST_F(EtcInittabTest, EmbeddedNulEndsTheCommandButNoOtherField) {
  using namespace std::string_literals;
  fill("al\0x:2:respawn:/bin/al\0pha\nbe:\0:once\0:/bin/beta\n\0ga:2:off:/c\n \0ga\nde:2\0\n"s);
  EtcInittab inittab;
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
    EXPECT_EQ(loaded(std::string(1023 - in_first, ' ') + line + "\n" + kBetaLine), expected);
  }
}

TEST_F(EtcInittabTest, LineWithoutAColonOf1023CharactersFillsAllFields) {
  const auto x = [](size_t length) { return std::string(length, 'x'); };
  const Entry full = {x(10), x(10), x(30), x(256)};
  for (const bool has_newline : {true, false}) {
    const std::string end = has_newline ? "\n" + kGammaLine : "";
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

TEST_F(EtcInittabTest, LongLinesComeInTheSamePiecesWhereverABlockOfTheFileEnds) {
  for (const size_t block_bytes : {2048U, 4096U, 16384U}) {
    for (size_t in_first_block = 1015; in_first_block <= 1030; ++in_first_block) {
      SCOPED_TRACE(std::to_string(block_bytes) + " " + std::to_string(in_first_block));
      EXPECT_THAT(loaded(std::string(block_bytes - in_first_block, '\n') + std::string(1021, ' ') +
                         "##alpha:2:respawn:x\n" + kBetaLine),
                  ElementsAre(Entry{"alpha", "2", "respawn", "x"}, kBeta));
    }
  }
}

TEST_F(EtcInittabTest, KeepsToASmallStack) {
  REQUIRE_OWN_MALLOC();  // and the frames
  std::string lines = "al:2:respawn:x\n";
  while (lines.size() < 40000) lines += "be:2:respawn:one of very many\n";
  // Once on a large stack, where the loader looks up what is called.
  for (const bool small : {false, true}) {
    writeFile(path, lines);
    writeFile(backup, "an old one, so that no account has to be looked up");
    bool done = false;
    const auto edit = [&] {
      EtcInittab file;
      done =
          file.readInittab() == OSUTILS_SUCCESS && file.deleteInittabEntry("al") == OSUTILS_SUCCESS;
    };
    if (small) {
      EXPECT_TRUE(keepsToASmallStack(edit));
    } else {
      edit();
    }
    EXPECT_TRUE(done);
    EXPECT_TRUE(contentsOf(path) == lines.substr(sizeof "al:2:respawn:x\n" - 1));
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

TEST_F(EtcInittabTest, LoadsThroughALinkAndNothingThroughADanglingOne) {
  const std::string target = temp.file("target", kAlphaLine);
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EtcInittab inittab;
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));

  ASSERT_EQ(unlink(target.c_str()), 0);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(add(inittab, kBeta), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_FALSE(pathExists(target));
}

TEST_F(EtcInittabTest, WaitsAtAPipeAndLoadsWhatAWriterSends) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  EtcInittab inittab;
  // Nobody writes until the library opens the pipe.
  std::thread writer;
  const BeforeCall open(Call::fopen64, [&] {
    writer = std::thread([&] {
      std::ofstream pipe(path);
      pipe << kAlphaLine << kBetaLine.substr(0, 4) << std::flush << kBetaLine.substr(4)
           << std::string(20000, '#') << "\n"
           << kGammaLine;
    });
  });

  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  ASSERT_TRUE(open.fired());
  writer.join();
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kBeta, kGamma));
}

TEST_F(EtcInittabTest, LoadingFromAMissingFileEmptiesTheList) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);
  const Records records;

  EXPECT_EQ(inittab.readInittab(), OSUTILS_NO_SUCH_OBJECT);

  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member(
          "readInittab", 32,
          kFreed + call("checkFilePerms", 32,
                        missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                            Trail{"D checkFilePerms - The file " + path + " does not exist.\n"}))));
}

TEST_F(EtcInittabTest, DirectoryIsNoInittabFile) {
  ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
  EtcInittab inittab;

  EXPECT_EQ(inittab.readInittab(), OSUTILS_CONSTRAINT_VIOLATION);
  EXPECT_EQ(add(inittab, kAlpha), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_TRUE(std::filesystem::is_directory(path));
}

TEST_F(EtcInittabTest, FileThatCannotBeOpenedForReading) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const int descriptors = openDescriptors();
  const Records records;
  const FailingCall open(Call::fopen64, EMFILE);

  EXPECT_EQ(inittab.readInittab(), OSUTILS_UNWILLING_TO_PERFORM);

  ASSERT_TRUE(open.fired());
  EXPECT_THAT(listOf(inittab), IsEmpty());
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member("readInittab", 53,
                              kFreed + kGoodFile + Trail{"D EtcInittab: fopen: errno =24\n"})));
}

TEST_F(EtcInittabTest, PermissionsAreThoseOfTheUser) {
  REQUIRE_ROOT("to become another user");
  writeFile(path, kAlphaLine);
  ASSERT_EQ(chmod(path.c_str(), 0600), 0);
  const std::string closed = temp.dir("closed");
  const std::string hidden = temp.file("closed/inittab", kAlphaLine);
  ASSERT_EQ(chmod(closed.c_str(), 0700), 0);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcInittab unreadable;
                     const Records records;
                     EXPECT_EQ(unreadable.readInittab(), OSUTILS_UNWILLING_TO_PERFORM);
                     EXPECT_THAT(records.texts(), ElementsAre("EtcInittab: fopen: errno =13\n"));
                     EXPECT_EQ(add(unreadable, kBeta), OSUTILS_INSUFFICIENT_ACCESS);

                     pointAt(hidden, backup);
                     EtcInittab invisible;
                     EXPECT_EQ(invisible.readInittab(), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_EQ(add(invisible, kBeta), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(path), kAlphaLine);
  EXPECT_EQ(contentsOf(hidden), kAlphaLine);
}

TEST_F(EtcInittabTest, LoadingIsAllOrNothingWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine + "# no entry\n" + kBetaLine + kGammaLine);
  EtcInittab inittab;
  const int descriptors = openDescriptors();
  int nth = 1;
  for (;; ++nth) {
    SCOPED_TRACE(nth);
    inittab.freeInittabEntries();
    const LiveAllocations memory;
    FailingCall allocation(Call::allocation, ENOMEM, nth);
    const int rc = inittab.readInittab();
    allocation.disarm();
    EXPECT_EQ(openDescriptors(), descriptors);
    if (!allocation.fired()) {
      EXPECT_EQ(rc, OSUTILS_SUCCESS);
      EXPECT_EQ(memory.blocks(), 3);
      break;
    }
    EXPECT_EQ(rc, OSUTILS_NO_MEMORY);
    EXPECT_THAT(listOf(inittab), IsEmpty());
    EXPECT_EQ(memory.blocks(), 0);
  }
  EXPECT_EQ(nth, 4) << "one record for each entry";
}

TEST_F(EtcInittabTest, FreesTheListBeforeItReportsThatMemoryRanOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine + kBetaLine);
  EtcInittab inittab;
  const Records records;
  const FailingCall allocation(Call::allocation, ENOMEM, 2);

  EXPECT_EQ(inittab.readInittab(), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "readInittab", 90,
                                   kFreed + kGoodFile + kFreed +
                                       Trail{"D EtcInittab: readInittab: ran out of memory.\n"})));
}

TEST_F(EtcInittabTest, ReadErrorEndsTheFile) {
  std::string contents = kAlphaLine;
  while (contents.size() < 40000) contents += "# filling the first blocks\n";
  writeFile(path, contents + kBetaLine);
  EtcInittab inittab;
  {
    const FailingCall read(Call::fread, EIO);
    EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    ASSERT_TRUE(read.fired());
    EXPECT_THAT(listOf(inittab), IsEmpty());
  }
  const FailingCall read(Call::fread, EIO, 2);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  ASSERT_TRUE(read.fired());
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
}

// ---- Adding ----

TEST_F(EtcInittabTest, AddsALineAtTheEndAndARecordAtTheHead) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const Records records;

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), kAlphaLine + kBetaLine);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("addInittabEntry", 0, kNotListed + kGoodFile)));
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta, kAlpha));
  EXPECT_EQ(add(inittab, kGamma), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), kAlphaLine + kBetaLine + kGammaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kGamma, kBeta, kAlpha));
}

TEST_F(EtcInittabTest, AddedEntryIsFoundWithoutLoadingAgain) {
  writeFile(path, "");
  EtcInittab inittab;

  EXPECT_EQ(add(inittab, {"vra0", "2", "once", "/bin/x"}), OSUTILS_SUCCESS);

  EXPECT_TRUE(inittab.doesInittabEntryExist("vra0"));
  EXPECT_TRUE(inittab.isCommandRegistered("bin/x"));
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("/bin/x")), "vra0");
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra1");
  EXPECT_EQ(add(inittab, {"vra0", "3", "off", "/bin/y"}), OSUTILS_ALREADY_EXISTS);
}

TEST_F(EtcInittabTest, AddsACommandThatIsThereUnderAnotherId) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(add(inittab, {"zz", "2", "respawn", "/bin/alpha"}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), kAlphaLine + "zz:2:respawn:/bin/alpha\n");
  EXPECT_EQ(taken(inittab.getEntryInitIDWithCommand("/bin/alpha")), "zz") << "the head";
}

TEST_F(EtcInittabTest, AddsToAnUnfinishedLastLineAsItStands) {
  writeFile(path, "al:2:respawn:/bin/alpha");
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "al:2:respawn:/bin/alpha" + kBetaLine);
}

TEST_F(EtcInittabTest, AddsFieldsAsTheyStandWithoutLookingAtThem) {
  writeFile(path, "");
  EtcInittab inittab;

  EXPECT_EQ(add(inittab, {"a:b", "", "", ""}), OSUTILS_SUCCESS);
  EXPECT_EQ(add(inittab, {"", "", "", ""}), OSUTILS_SUCCESS);
  EXPECT_EQ(add(inittab, {"#c", " ", "%s%n", "100% \\ \"x\"\t"}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "a:b:::\n:::\n#c: :%s%n:100% \\ \"x\"\t\n");
  EXPECT_TRUE(inittab.doesInittabEntryExist("a:b"));
  EXPECT_TRUE(inittab.doesInittabEntryExist(""));
  EXPECT_EQ(add(inittab, {"", "2", "once", "x"}), OSUTILS_ALREADY_EXISTS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"a", "b", "", ":"}));
}

TEST_F(EtcInittabTest, RefusesAListedIdBeforeItLooksAtTheFile) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);
  Records records;

  EXPECT_EQ(add(inittab, {"al", "5", "off", "/bin/other"}), OSUTILS_ALREADY_EXISTS);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("addInittabEntry", 68, kListed)));

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_NO_SUCH_OBJECT);
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
    EtcInittab inittab;

    EXPECT_EQ(add(inittab, whole), OSUTILS_SUCCESS);

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
  EtcInittab inittab;
  EXPECT_EQ(add(inittab, {"al", "2", "once", command}), OSUTILS_SUCCESS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"al", "2", "once", command.substr(0, 256)}));
  EXPECT_EQ(contentsOf(path), "al:2:once:" + command + "\n");
}

TEST_F(EtcInittabTest, AddsACommandOf100000Characters) {
  const std::string command(100000, 'c');
  writeFile(path, "");
  EtcInittab inittab;

  EXPECT_EQ(add(inittab, {"al", "2", "once", command}), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "al:2:once:" + command + "\n");
  EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"al", "2", "once", command.substr(0, 256)}));
}

TEST_F(EtcInittabTest, AddWithoutMemoryForTheRecordChangesNothing) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const Records records;
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall allocation(Call::allocation, ENOMEM);

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(opens.calls(), 0);
  EXPECT_EQ(contentsOf(path), kAlphaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member(
          "addInittabEntry", 90,
          kNotListed + kGoodFile + Trail{"D EtcInittab::addInittabEntry ran out of memory.\n"})));
}

TEST_F(EtcInittabTest, AddToAFileThatCannotBeOpenedChangesNothing) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall open(Call::fopen64, EROFS);

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_INSUFFICIENT_ACCESS);

  ASSERT_TRUE(open.fired());
  EXPECT_EQ(contentsOf(path), kAlphaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "addInittabEntry", 50,
                                   kNotListed + kGoodFile +
                                       Trail{"D EtcInittab::addInittabEntry fopen: errno=30.\n"})));
}

TEST_F(EtcInittabTest, AddWithoutItsLineChangesNothing) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall closes(Call::fclose, 0, kNever);
  const FailingCall print(Call::vra_asprintf, ENOMEM);

  EXPECT_EQ(add(inittab, kBeta), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(closes.calls(), 1);
  EXPECT_EQ(contentsOf(path), kAlphaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member(
          "addInittabEntry", 90,
          kNotListed + kGoodFile + Trail{"D EtcInittab::addInittabEntry vra_asprintf failed.\n"})));
}

TEST_F(EtcInittabTest, AddDoesNotLookAtTheResultsOfWritingAndClosing) {
  for (const Call failing : {Call::fwrite, Call::fclose}) {
    writeFile(path, kAlphaLine);
    EtcInittab inittab;
    inittab.readInittab();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const FailingCall failure(failing, ENOSPC);

    EXPECT_EQ(add(inittab, kBeta), OSUTILS_SUCCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path), failing == Call::fwrite ? kAlphaLine : kAlphaLine + kBetaLine);
    EXPECT_THAT(listOf(inittab), ElementsAre(kBeta, kAlpha));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1) << "the record";
  }
}

// ---- Deleting ----

TEST_F(EtcInittabTest, DeletesTheLineAndTheRecord) {
  writeFile(path, kAlphaLine + kBetaLine + kGammaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;

  EXPECT_EQ(inittab.deleteInittabEntry("be"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), kAlphaLine + kGammaLine);
  EXPECT_FALSE(pathExists(backup));
  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kGamma));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("deleteInittabEntry", 0,
                                      kListed + kGoodFile + copiedToNewFile() + kDeleted)));
}

TEST_F(EtcInittabTest, FreesTheDeletedRecord) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, kAlphaLine + kBetaLine);
  const LiveAllocations memory;
  EtcInittab inittab;
  inittab.readInittab();
  EXPECT_EQ(memory.blocks(), 3);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  EXPECT_EQ(memory.blocks(), 2);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta));
}

TEST_F(EtcInittabTest, DeletesAllLinesOfAnIdButOnlyItsFirstRecord) {
  writeFile(path, kAlphaLine + kBetaLine + "al:5:off:/bin/other\nal:no colon more\n");
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), kBetaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta, Entry{"al", "5", "off", "/bin/other"},
                                           Entry{"al", "no colon m", "ore\n", ""}));
  EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
  EXPECT_EQ(add(inittab, kAlpha), OSUTILS_ALREADY_EXISTS);
  EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
  EXPECT_FALSE(inittab.doesInittabEntryExist("al"));
}

TEST_F(EtcInittabTest, DeleteKeepsEveryOtherLineAsItStands) {
  using namespace std::string_literals;
  const std::string kept =
      "# al:2:once:x\n\n   \t\n#al:\n:al:2\nal\nal \nal :2:once:x\nal\t:2:once:x\n"
      " \t be  :2:once:al:x # al:\r\nAl:2:once:x\nalp:2:once:x\na:2:once:x\n1al:2\nAL:\n"
      "x:al:al:al\nnul\0al:2:once:x\0\n"s;
  EXPECT_EQ(without("al", kept + kAlphaLine + kept), kept + kept);
  EXPECT_EQ(without("al", " \t\v\f\r al:2\n" + kept), kept);
  EXPECT_EQ(without("al", kept + "al:2"), kept);
  EXPECT_EQ(without("al", kAlphaLine + kept + "be:2"), kept + "be:2");
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
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_FALSE(inittab.doesInittabEntryExist("al"));
  EXPECT_TRUE(inittab.doesInittabEntryExist("al\n"));
  EXPECT_EQ(taken(inittab.findAvaliableID()), "vra0");
  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_EQ(contentsOf(path), "al\nvra0\n");
  EXPECT_EQ(add(inittab, kAlpha), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), "al\nvra0\n" + kAlphaLine);
}

// The record that the id belongs to is freed on the way.
TEST_F(EtcInittabTest, DeletesByTheIdOfTheRecordItself) {
  fill(kAlphaLine + kBetaLine);
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry(inittab.getInittabEntry("al")->id), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), kBetaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta));
}

TEST_F(EtcInittabTest, DeleteTakesALineWhoseIdEndsAtANul) {
  using namespace std::string_literals;
  EXPECT_EQ(without("al", "al:2\nal\0more:2\nal\0more\nbe:2\n"s), "be:2\n");
}

TEST_F(EtcInittabTest, DeleteOfAnIdWithAColonFindsNoLine) {
  fill("a:b:2:once:x\n");
  EtcInittab inittab;
  ASSERT_EQ(add(inittab, {"a:b", "2", "once", "x"}), OSUTILS_SUCCESS);
  const std::string contents = contentsOf(path);

  EXPECT_EQ(inittab.deleteInittabEntry("a:b"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), contents);
  EXPECT_THAT(listOf(inittab), IsEmpty());
}

TEST_F(EtcInittabTest, DeleteKeepsTheLineOfAnIdThatIsNoneInTheFile) {
  for (const char* const id : {"#c", "", "-x"}) {
    SCOPED_TRACE(id);
    fill(kAlphaLine);
    EtcInittab inittab;
    ASSERT_EQ(add(inittab, {id, "2", "once", "x"}), OSUTILS_SUCCESS);

    EXPECT_EQ(inittab.deleteInittabEntry(id), OSUTILS_SUCCESS);

    EXPECT_EQ(contentsOf(path), kAlphaLine + id + ":2:once:x\n");
    EXPECT_THAT(listOf(inittab), IsEmpty());
  }
}

TEST_F(EtcInittabTest, DeleteTakesLongLinesPieceByPiece) {
  std::string line = "al:2:once:" + std::string(5000, 'x') + "\n";
  EXPECT_EQ(without("al", line + kBetaLine), line.substr(1023) + kBetaLine);

  // The second piece goes with its newline: the first one is joined by the next line.
  const std::string blanks(1023, ' ');
  EXPECT_EQ(without("al", blanks + kAlphaLine + kBetaLine), blanks + kBetaLine);
  // A whole piece has no newline, so the id alone is enough, as at the end of the file.
  const std::string piece = std::string(1021, ' ') + "al";
  EXPECT_EQ(without("al", kAlphaLine + piece + "x\n"), "x\n");
  EXPECT_EQ(without("al", kAlphaLine + piece.substr(1) + "x\n"), piece.substr(1) + "x\n");
  for (const size_t length : {1022U, 1023U, 1024U, 1025U}) {
    SCOPED_TRACE(length);
    line = "al:2:once:";
    line += std::string(length - line.size() - 1, '#') + "\n";
    EXPECT_EQ(without("al", line + kBetaLine),
              (length <= 1023 ? "" : line.substr(1023)) + kBetaLine);
    EXPECT_EQ(without("be", line + kBetaLine), line);
  }
}

TEST_F(EtcInittabTest, DeleteOfAnUnlistedIdLooksAtNoFile) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);

  for (const char* const id : {"be", "Al", "al ", "al:", ""}) {
    const Records records;
    EXPECT_EQ(inittab.deleteInittabEntry(id), OSUTILS_NO_SUCH_OBJECT);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("deleteInittabEntry", 32, kNotListed)));
  }
}

TEST_F(EtcInittabTest, DeleteAnswersWhatTheFileIs) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  ASSERT_EQ(unlink(path.c_str()), 0);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_NO_SUCH_OBJECT);
  ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
  EXPECT_FALSE(pathExists(backup));
}

TEST_F(EtcInittabTest, DeleteFromALinkEditsItsTarget) {
  const std::string target = temp.file("target", kAlphaLine + kBetaLine);
  ASSERT_EQ(chmod(target.c_str(), 0604), 0);
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EtcInittab inittab;
  inittab.readInittab();

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  EXPECT_TRUE(std::filesystem::is_symlink(path));
  EXPECT_EQ(contentsOf(target), kBetaLine);
  EXPECT_EQ(modeOf(target), 0604U);
}

// ---- The backup ----

TEST_F(EtcInittabTest, NewBackupIsWholeAndHasMode0640WhileItExists) {
  writeFile(path, kAlphaLine + kBetaLine);
  EtcInittab inittab;
  inittab.readInittab();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(backup);
        mode = modeOf(backup);
      },
      3);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, kAlphaLine + kBetaLine);
  EXPECT_EQ(mode, 0640U);
  EXPECT_FALSE(pathExists(backup));
  EXPECT_EQ(umask(022), 026U) << "set for the new backup, and left so";
}

TEST_F(EtcInittabTest, ExistingBackupKeepsItsModeAndIsRemoved) {
  writeFile(path, kAlphaLine + kBetaLine);
  writeFile(backup, "an old copy, which is much longer than the file that takes its place now\n");
  ASSERT_EQ(chmod(backup.c_str(), 0600), 0);
  EtcInittab inittab;
  inittab.readInittab();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(backup);
        mode = modeOf(backup);
      },
      4);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, kAlphaLine + kBetaLine);
  EXPECT_EQ(mode, 0600U);
  EXPECT_FALSE(pathExists(backup));
  EXPECT_EQ(umask(022), 022U) << "only a new backup sets it";
}

TEST_F(EtcInittabTest, BackupIsMadeWhereItIsWantedAtTheTimeOfTheCall) {
  writeFile(path, kAlphaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const std::string elsewhere = temp.path("elsewhere");
  EtcInittab::ETC_INITTAB_FILE_BACKUP = elsewhere.c_str();
  bool was_there = false;
  const BeforeCall opened(
      Call::fopen64, [&] { was_there = pathExists(elsewhere); }, 3);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  EXPECT_TRUE(was_there);
  EXPECT_FALSE(pathExists(elsewhere));
}

// What a failed copy leaves: the file and the list as they were.
TEST_F(EtcInittabTest, DeleteWithoutABackupChangesNothing) {
  const std::string contents = kAlphaLine + kBetaLine;
  writeFile(path, contents);
  const std::string directory = temp.dir("directory");
  const std::string below_nothing = temp.path("missing/backup");
  const std::string hard_link = temp.path("hard");
  ASSERT_EQ(link(path.c_str(), hard_link.c_str()), 0);
  const std::string soft_link = temp.path("soft");
  ASSERT_EQ(symlink(path.c_str(), soft_link.c_str()), 0);
  EtcInittab inittab;
  inittab.readInittab();
  const int descriptors = openDescriptors();

  for (const char* const place :
       {directory.c_str(), below_nothing.c_str(), path.c_str(), hard_link.c_str(),
        soft_link.c_str(), static_cast<const char*>(nullptr)}) {
    const std::string shown = place == nullptr ? "(null)" : place;
    SCOPED_TRACE(shown);
    EtcInittab::ETC_INITTAB_FILE_BACKUP = place;
    const Records records;

    EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kBeta));
    EXPECT_EQ(openDescriptors(), descriptors);
    const Trail trail = records.trail();
    ASSERT_GE(trail.size(), 2U);
    EXPECT_EQ(trail[trail.size() - 2],
              "D EtcInittab::deleteInittabEntry copy of " + path + " to " + shown + " failed.\n");
    EXPECT_EQ(trail.back(), "<! EtcInittab::deleteInittabEntry 50");
  }
  EXPECT_TRUE(pathExists(hard_link));
  EXPECT_TRUE(pathExists(soft_link));
}

TEST_F(EtcInittabTest, DeleteTrustsNoBackupThatItCannotExamine) {
  const std::string contents = kAlphaLine + kBetaLine;
  writeFile(path, contents);
  EtcInittab inittab;
  inittab.readInittab();
  // The look at the file behind checkFilePerms, and the last look at the copy.
  for (const int nth : {3, 12}) {
    SCOPED_TRACE(nth);
    const FailingCall status(Call::stat64, EIO, nth);

    EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(status.fired());
    EXPECT_EQ(status.calls(), nth);
    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kBeta));
  }
  EXPECT_EQ(contentsOf(backup), contents);
}

TEST_F(EtcInittabTest, DeleteReportsTheFailedCopyAfterTheRecordsOfTheCopy) {
  writeFile(path, kAlphaLine);
  ASSERT_EQ(mkdir(backup.c_str(), 0755), 0);
  EtcInittab inittab;
  inittab.readInittab();
  const Records records;

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "deleteInittabEntry", 50,
                                   kListed + kGoodFile +
                                       call("copyFile", 0,
                                            kCopySource + call("doesFileExist", 1) +
                                                call("canWriteToFile", 0, call("isDirectory", 1))) +
                                       Trail{"D EtcInittab::deleteInittabEntry copy of " + path +
                                             " to " + backup + " failed.\n"})));
}

TEST_F(EtcInittabTest, DeleteByAUserWhoMayNotWriteChangesNothing) {
  REQUIRE_ROOT("to become another user");
  writeFile(path, kAlphaLine);
  ASSERT_EQ(chmod(path.c_str(), 0644), 0);
  const std::string open_to_all = temp.dir("open");
  ASSERT_EQ(chmod(open_to_all.c_str(), 0777), 0);
  const std::string writable_backup = open_to_all + "/backup";
  EXPECT_EQ(
      asUser(kNobody,
             [&] {
               EtcInittab inittab;
               EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
               EXPECT_EQ(add(inittab, kBeta), OSUTILS_INSUFFICIENT_ACCESS);
               EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);
               EXPECT_FALSE(pathExists(backup));

               // The backup can be made here, but the file cannot be written.
               EtcInittab::ETC_INITTAB_FILE_BACKUP = writable_backup.c_str();
               const Records records;
               EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);
               EXPECT_FALSE(pathExists(writable_backup));
               const Trail tail = Trail{"D EtcInittab::deleteInittabEntry fopen: errno=13.\n"} +
                                  kDeleted + Trail{"<! EtcInittab::deleteInittabEntry 50"};
               const Trail trail = records.trail();
               EXPECT_GT(trail.size(), tail.size());
               EXPECT_EQ(Trail(trail.end() - static_cast<long>(tail.size()), trail.end()), tail);
               EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha));
               return 0;
             }),
      0);
  EXPECT_EQ(contentsOf(path), kAlphaLine);
}

TEST_F(EtcInittabTest, DeleteWhenTheBackupOrTheFileCannotBeOpened) {
  const std::string contents = kAlphaLine + kBetaLine;
  const struct {
    bool backup_fails;
    bool file_fails;
    const char* error;
    std::string left;
  } cases[] = {
      {true, false, "24", ""},  // the file was opened, and thereby emptied, all the same
      {false, true, "23", contents},
      {true, true, "23", contents},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(std::to_string(with.backup_fails) + " " + std::to_string(with.file_fails));
    writeFile(path, contents);
    EtcInittab inittab;
    inittab.readInittab();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const Records records;
    const FailingCall backup_open(Call::fopen64, EMFILE, with.backup_fails ? 3 : kNever);
    const FailingCall file_open(Call::fopen64, ENFILE, with.file_fails ? 4 : kNever);

    EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(backup_open.calls(), 4) << "both are opened before either is looked at";
    EXPECT_EQ(contentsOf(path), with.left);
    EXPECT_FALSE(pathExists(backup));
    EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kBeta));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(
        records.trail(),
        ElementsAreArray(member("deleteInittabEntry", 50,
                                kListed + kGoodFile + copiedToNewFile() +
                                    Trail{std::string("D EtcInittab::deleteInittabEntry fopen: "
                                                      "errno=") +
                                          with.error + ".\n"} +
                                    kDeleted)));
  }
}

TEST_F(EtcInittabTest, DeleteKeepsTheBackupOfALineThatCouldNotBeWritten) {
  const std::string contents = kAlphaLine + kBetaLine + kGammaLine;
  const struct {
    Call call;
    int nth;
    std::string left;
  } cases[] = {
      {Call::fwrite, 1, kGammaLine},
      {Call::fwrite, 2, kBetaLine},
      {Call::fclose, 4, kBetaLine + kGammaLine},  // behind the copy's two and the backup's
      {Call::fread, 1, ""},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.left);
    writeFile(path, contents);
    EtcInittab inittab;
    inittab.readInittab();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);

    EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path), with.left);
    EXPECT_EQ(contentsOf(backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_THAT(listOf(inittab), ElementsAre(kAlpha, kBeta, kGamma));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteInittabEntry", 50,
                                        kListed + kGoodFile + copiedToNewFile() +
                                            // The other way round than for the copy to the backup.
                                            Trail{"D EtcInittab::deleteInittabEntry copy of " +
                                                  backup + " to " + path + " failed.\n"})));
    ASSERT_EQ(unlink(backup.c_str()), 0);
  }
}

TEST_F(EtcInittabTest, DeleteDoesNotMindABackupThatCannotBeRemoved) {
  writeFile(path, kAlphaLine + kBetaLine);
  EtcInittab inittab;
  inittab.readInittab();
  const FailingCall removal(Call::remove, EBUSY);

  EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_SUCCESS);

  ASSERT_TRUE(removal.fired());
  EXPECT_EQ(contentsOf(path), kBetaLine);
  EXPECT_EQ(contentsOf(backup), kAlphaLine + kBetaLine);
  EXPECT_THAT(listOf(inittab), ElementsAre(kBeta));
}

// A tmpfs of this many bytes in a mount table of the child's own.
bool mountSmallDisk(const std::string& directory, size_t bytes) {
  const std::string options = "size=" + std::to_string(bytes);
  return mount("osutils-test", directory.c_str(), "tmpfs", 0, options.c_str()) == 0;
}

// More than fits on the disk above.
std::string manyLines() {
  std::string lines = kAlphaLine;
  while (lines.size() < 40000) lines += kBetaLine;
  return lines;
}

constexpr size_t kSmallDiskBytes = 64 * 1024;

TEST_F(EtcInittabTest, DeleteTouchesNothingWhenTheBackupDoesNotFitItsDisk) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = manyLines();
  writeFile(path, contents);
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, 16 * 1024)) return 1;
              const std::string small = disk + "/backup";
              EtcInittab::ETC_INITTAB_FILE_BACKUP = small.c_str();
              EtcInittab inittab;
              EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
              const Records records;

              EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
              EXPECT_THAT(records.texts(),
                          testing::Contains("EtcInittab::deleteInittabEntry copy of " + path +
                                            " to " + small + " failed.\n"));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(path), contents);
}

TEST_F(EtcInittabTest, DeleteKeepsTheBackupWhenTheDiskFillsUpMeanwhile) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = manyLines();
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/inittab";
              writeFile(small, contents);
              pointAt(small, backup);
              EtcInittab inittab;
              EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
              // The file has just been emptied: somebody else takes its place.
              const BeforeCall written(Call::fwrite, [&] {
                std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              });

              EXPECT_EQ(inittab.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(written.fired());
              EXPECT_LT(contentsOf(small).size(), contents.size() / 2);
              EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(backup), contents);
}

TEST_F(EtcInittabTest, AddToAFullDiskIsNotReported) {
  REQUIRE_ROOT("for a small file system");
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/inittab";
              writeFile(small, "");
              std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              pointAt(small, backup);
              EtcInittab inittab;

              EXPECT_EQ(add(inittab, kAlpha), OSUTILS_SUCCESS);

              EXPECT_EQ(contentsOf(small), "");
              EXPECT_TRUE(inittab.doesInittabEntryExist("al"));
              return 0;
            }),
            0);
}

// ---- The system's own file ----

TEST(EtcInittabOfTheSystem, IsEditedInPlaceUnlessTheProgramSaysOtherwise) {
  REQUIRE_ROOT("for a private /etc");
  EXPECT_EQ(
      withPrivateEtc([] {
        const std::string before = "# system\nid:3:initdefault:\n1:2345:respawn:/sbin/getty\n";
        writeFile("/etc/inittab", before);
        EtcInittab inittab;
        EXPECT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
        EXPECT_THAT(listOf(inittab), ElementsAre(Entry{"id", "3", "initdefault", ""},
                                                 Entry{"1", "2345", "respawn", "/sbin/getty"}));
        const std::string id = taken(inittab.findAvaliableID());

        EXPECT_EQ(add(inittab, {id, "2345", "once", "/opt/bin/start > /dev/null 2>&1"}),
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

// ---- The disk ----

// Whether the backup is new, old, behind a link or in a folder that the user may not read.
TEST_F(EtcInittabTest, DeleteLosesNoLineWhereverThePowerFails) {
  const std::string contents = kAlphaLine + kBetaLine + "# a comment\n" + kGammaLine;
  const std::string target = temp.dir("elsewhere") + "/target";
  const struct {
    const char* backup;
    bool is_link;
    bool is_there;
  } cases[] = {{"new", false, false},
               {"old", false, true},
               {"link to an old one", true, true},
               {"link to nothing", true, false}};
  for (const auto& with : cases) {
    SCOPED_TRACE(with.backup);
    writeFile(path, contents);
    const std::string& copy = with.is_link ? target : backup;
    if (with.is_link) {
      ASSERT_EQ(symlink(target.c_str(), backup.c_str()), 0);
    }
    std::map<std::string, std::string> files = {{path, contents}};
    if (with.is_there) {
      writeFile(copy,
                "an old copy, which is much longer than the file that replaces it, all of it\n");
      files[copy] = contentsOf(copy);
    }
    EtcInittab editor;
    editor.readInittab();
    const FileSteps steps;

    EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_SUCCESS);

    std::map<std::string, std::string> now = {{path, contentsOf(path)}};
    if (with.is_link) now[copy] = contentsOf(copy);  // only the link is removed
    EXPECT_EQ(lostLines(steps.all(), files, now, {kBetaLine, "# a comment\n", kGammaLine}), "");
    unlink(target.c_str());
  }
}

TEST_F(EtcInittabTest, DeleteLosesNoLineInAFolderThatMayNotBeRead) {
  REQUIRE_ROOT("to become another user");
  const std::string contents = kAlphaLine + kBetaLine;
  const std::string folder = temp.dir("folder");
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod(folder.c_str(), 0733), 0);
  path = folder + "/file";
  backup = folder + "/backup";
  writeFile(path, contents);
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  pointAt(path, backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcInittab editor;
                     editor.readInittab();
                     const FileSteps steps;
                     EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_SUCCESS);
                     EXPECT_EQ(lostLines(steps.all(), {{path, contents}}, {{path, kBetaLine}},
                                         {kBetaLine}),
                               "");
                     return 0;
                   }),
            0);
}

TEST_F(EtcInittabTest, DeleteChangesNothingWhenTheBackupCannotBeForcedToTheDisk) {
  const std::string contents = kAlphaLine + kBetaLine;
  const struct {
    const char* what;
    Call call;
    int nth;
    Call also;  // fails as well
    int also_nth;
  } cases[] = {
      {"its contents", Call::fsync, 1, Call::syncfs, kNever},
      {"its name", Call::fsync, 2, Call::syncfs, kNever},
      {"its file system", Call::syncfs, 1, Call::open64, 3},  // the folder cannot be opened
      {"nothing of it", Call::open64, 2, Call::syncfs, kNever},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.what);
    writeFile(path, contents);
    EtcInittab editor;
    editor.readInittab();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);
    const FailingCall other_failure(with.also, EACCES, with.also_nth);

    EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_FALSE(pathExists(backup));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(listOf(editor).size(), 2U);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteInittabEntry", 50,
                                        kListed + kGoodFile + copiedToNewFile() + kDeleted +
                                            Trail{"D EtcInittab::deleteInittabEntry copy of " +
                                                  path + " to " + backup + " failed.\n"})));
  }
}

TEST_F(EtcInittabTest, DeleteKeepsTheBackupWhenTheFileCannotBeForcedToTheDisk) {
  const std::string contents = kAlphaLine + kBetaLine;
  for (const Call call : {Call::fsync, Call::fflush}) {
    SCOPED_TRACE(static_cast<int>(call));
    writeFile(path, contents);
    EtcInittab editor;
    editor.readInittab();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(call, EIO, call == Call::fsync ? 3 : 1);

    EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(listOf(editor).size(), 2U);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteInittabEntry", 50,
                                        kListed + kGoodFile + copiedToNewFile() +
                                            Trail{"D EtcInittab::deleteInittabEntry copy of " +
                                                  backup + " to " + path + " failed.\n"})));
    ASSERT_EQ(unlink(backup.c_str()), 0);
  }
}

TEST_F(EtcInittabTest, DeleteGoesOnWhereNothingCanBeForcedAndAfterASignal) {
  for (const int reason : {EINVAL, EINTR}) {
    for (const int nth : {1, 2, 3}) {
      SCOPED_TRACE(std::to_string(reason) + " " + std::to_string(nth));
      writeFile(path, kAlphaLine + kBetaLine);
      EtcInittab editor;
      editor.readInittab();
      const FailingCall failure(Call::fsync, reason, nth);

      EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_SUCCESS);

      ASSERT_TRUE(failure.fired());
      EXPECT_EQ(failure.calls(), reason == EINTR ? 4 : 3);
      EXPECT_EQ(contentsOf(path), kBetaLine);
      EXPECT_FALSE(pathExists(backup));
    }
  }
}

// The folder of the backup is opened by its name, which may be short or too long for a small stack.
TEST_F(EtcInittabTest, DeleteForcesTheBackupsNameWhateverItsPath) {
  const std::string folder = temp.path();
  std::string deep = folder;
  while (deep.size() < 1200)
    deep = temp.dir((deep.substr(folder.size()) + "/0123456789").substr(1));
  const struct {
    std::string path;
    std::string forced;  // nothing for the whole file system
  } cases[] = {{"backup", folder},
               {"./backup", folder},
               {"/osutils-test-backup", "/"},
               {deep + "/backup", ""}};
  for (const auto& with : cases) {
    if (with.forced == "/" && access("/", W_OK) != 0) continue;
    SCOPED_TRACE(with.path);
    EXPECT_EQ(inChild([&] {
                EXPECT_EQ(chdir(folder.c_str()), 0);
                writeFile(path, kAlphaLine);
                pointAt(path, with.path);
                EtcInittab editor;
                editor.readInittab();
                const FileSteps steps;
                EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_SUCCESS);
                std::string forced = "nothing";
                for (const FileStep& step : steps.all()) {
                  if (step.kind == FileStep::kForcedAll) forced = "";
                  if (step.kind == FileStep::kForced && std::filesystem::is_directory(step.path)) {
                    forced = step.path;
                  }
                }
                EXPECT_EQ(forced, with.forced);
                EXPECT_FALSE(pathExists(with.path));
                return 0;
              }),
              0);
  }
}

TEST_F(EtcInittabTest, DeleteByAUserWhoMayNotReadTheOldBackupEmptiesTheFile) {
  REQUIRE_ROOT("to become another user");
  const std::string folder = temp.dir("folder");
  ASSERT_EQ(chmod(folder.c_str(), 0777), 0);
  path = folder + "/file";
  backup = folder + "/backup";
  writeFile(path, kAlphaLine + kBetaLine);
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  writeFile(backup, "old");
  ASSERT_EQ(chmod(backup.c_str(), 0222), 0);
  pointAt(path, backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcInittab editor;
                     editor.readInittab();
                     EXPECT_EQ(editor.deleteInittabEntry("al"), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(path), "");
  EXPECT_FALSE(pathExists(backup));
}

// ---- Cancellation ----

// Every call of an edit, as the one that a request to end the thread comes with. The edit is
// finished all the same, and the thread ends behind it.
TEST_F(EtcInittabTest, EditsAreFinishedByAThreadThatIsCancelled) {
  const std::string contents = kAlphaLine + kBetaLine;
  const struct {
    const char* what;
    std::function<int(EtcInittab&)> edit;
    std::vector<Call> calls;
    std::string left;
    int blocks;  // of the list
  } cases[] = {
      {"load",
       [](EtcInittab& editor) { return editor.readInittab(); },
       {Call::stat64, Call::fopen64, Call::allocation, Call::fread, Call::fclose},
       contents,
       2},
      {"add",
       [](EtcInittab& editor) { return editor.addInittabEntry("ga", "", "off", "/bin/gamma"); },
       {Call::stat64, Call::allocation, Call::fopen64, Call::vra_asprintf, Call::fwrite,
        Call::fclose},
       contents + kGammaLine,
       1},
      {"delete",
       [](EtcInittab& editor) { return editor.deleteInittabEntry("al"); },
       {Call::stat64, Call::open64, Call::fchown, Call::close, Call::fopen64, Call::copy_file_range,
        Call::read, Call::fsync, Call::fread, Call::fwrite, Call::fflush, Call::fclose,
        Call::remove},
       kBetaLine,
       0},
  };
  for (const auto& with : cases) {
    for (const Call at : with.calls) {
      if (at == Call::allocation && sanitizerOwnsMalloc()) continue;
      SCOPED_TRACE(with.what + (" " + std::to_string(static_cast<int>(at))));
      EXPECT_EQ(inChild([&] {
                  for (int nth = 1;; ++nth) {
                    SCOPED_TRACE(nth);
                    writeFile(path, contents);
                    EtcInittab editor;
                    if (with.blocks != 2) editor.readInittab();
                    const int descriptors = openDescriptors();
                    int answer = -1;
                    const CancelledCall call =
                        cancelledAt(at, nth, [&] { answer = with.edit(editor); });
                    EXPECT_TRUE(call.returned);
                    EXPECT_EQ(answer, OSUTILS_SUCCESS);
                    EXPECT_EQ(call.ended, call.asked);
                    EXPECT_EQ(contentsOf(path), with.left);
                    EXPECT_FALSE(pathExists(backup));
                    EXPECT_EQ(openDescriptors(), descriptors);
                    EXPECT_EQ(call.blocks, sanitizerOwnsMalloc() ? 0 : with.blocks);
                    if (!call.asked || testing::Test::HasFailure()) return nth == 1 ? 1 : 0;
                  }
                }),
                0);
    }
  }
}

// ---- Any file ----

// The pieces of a file as the editor must see them, found in the plainest way.
std::vector<std::string> piecesOf(const std::string& contents) {
  std::vector<std::string> pieces;
  bool complete = true;
  for (const char c : contents) {
    if (complete) pieces.emplace_back();
    pieces.back() += c;
    complete = c == '\n' || pieces.back().size() == 1023;
  }
  return pieces;
}

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
    EtcInittab inittab;
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
    EtcInittab inittab;
    ASSERT_EQ(inittab.readInittab(), OSUTILS_SUCCESS);
    const std::vector<std::string> before = recordsOf(inittab);
    const std::string id = taken(inittab.findAvaliableID());
    const std::string command = "/bin/" + std::string(random.below(300), 'n');

    ASSERT_EQ(add(inittab, {id, "2345", "respawn", command}), OSUTILS_SUCCESS);
    ASSERT_EQ(contentsOf(path), contents + id + ":2345:respawn:" + command + "\n");
    ASSERT_EQ(inittab.deleteInittabEntry(id.c_str()), OSUTILS_SUCCESS);

    ASSERT_EQ(contentsOf(path), contents);
    ASSERT_EQ(recordsOf(inittab), before);
  }
}

}  // namespace
