// EtcInittab on random files, compared with a simple model.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stddef.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "editors.h"
#include "inittab_model.h"
#include "osutils.h"
#include "world.h"

using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

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
        // Near the length limit of a piece or of a field.
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

  // Few names, so that they repeat.
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
    ASSERT_EQ(list, modelInittab(contents));
    entries_seen += list.size();
  }
  EXPECT_GT(entries_seen, kFiles) << "too few to prove anything";
}

TEST_F(EtcInittabTest, DeletesFromAnyFileTheLinesOfThatId) {
  size_t shortened = 0;
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents();
    const std::vector<std::string> list = modelInittab(contents);
    if (list.empty()) continue;
    // The id reads on until the first NUL of the record.
    const std::string id = upToNul(list[random.below(list.size())]);
    const std::string left = without(id, contents);
    ASSERT_EQ(left, modelWithoutEntry(id, contents));
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
