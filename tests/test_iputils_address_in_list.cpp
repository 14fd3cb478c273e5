#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_iputils.h"

using testing::ElementsAre;

namespace {

// A list as a caller passes it. "(null)" stands for a null entry.
class List {
 public:
  explicit List(std::vector<std::string> texts) : texts_(std::move(texts)) {
    for (std::string& text : texts_) {
      entries_.push_back(text == "(null)" ? nullptr : text.data());
    }
  }
  List(const List&) = delete;
  List& operator=(const List&) = delete;

  char** entries() { return entries_.data(); }
  int count() const { return static_cast<int>(entries_.size()); }

 private:
  std::vector<std::string> texts_;
  std::vector<char*> entries_;
};

TEST(AddressInList, RefusesANullOrEmptyAddressAndANullList) {
  List list({"10.0.0.1", ""});
  char empty[] = "";
  char address[] = "10.0.0.1";
  const struct {
    char* address;
    char** list;
  } cases[] = {
      {nullptr, list.entries()}, {empty, list.entries()}, {address, nullptr}, {nullptr, nullptr}};
  for (const auto& refused : cases) {
    const Records records;
    EXPECT_FALSE(isValidIPAddressInList(refused.address, refused.list, 2));
    EXPECT_THAT(records.trail(),
                ElementsAre("> isValidIPAddressInList", kBlank, "< isValidIPAddressInList 0"));
  }
}

TEST(AddressInList, ComparesWholeTextsWithoutRegardToCase) {
  const struct {
    std::string address;
    std::vector<std::string> texts;
    bool valid;
  } cases[] = {
      {"10.0.0.1", {"10.0.0.1"}, true},
      {"10.0.0.1", {"10.0.0.12"}, false},
      {"10.0.0.12", {"10.0.0.1"}, false},
      {"10.0.0.1", {"110.0.0.1"}, false},
      {"10.0.0.1", {"10.0.0.2", "10.0.0.12", "10.0.0.1"}, true},
      {"10.0.0.1", {"10.0.0.1", "10.0.0.2"}, true},
      {"2001:DB8::AB", {"2001:db8::ab"}, true},
      {"2001:db8::ab", {"2001:DB8::AB"}, true},
      {"2001:db8::ab", {"2001:db8::abc"}, false},
      {"10.0.0.1", {"(null)", "", "(null)", "10.0.0.1"}, true},
      {"10.0.0.1", {"(null)", "(null)"}, false},
      {"10.0.0.1", {""}, false},
      {"10.0.0.1", {" 10.0.0.1", "10.0.0.1 "}, false},
      {"::1", {"0:0:0:0:0:0:0:1"}, false},
  };
  for (const auto& [address, texts, valid] : cases) {
    SCOPED_TRACE(address + " in " + testing::PrintToString(texts));
    std::string asked = address;
    List list(texts);
    const Records records;
    const LiveAllocations live;

    EXPECT_EQ(isValidIPAddressInList(asked.data(), list.entries(), list.count()), valid);

    EXPECT_THAT(records.trail(), ElementsAre("> isValidIPAddressInList",
                                             left("isValidIPAddressInList", valid ? 1 : 0)));
    EXPECT_EQ(live.blocks(), 0);
    EXPECT_EQ(asked, address);
  }
}

TEST(AddressInList, LooksAtTheFirstCountEntriesOnly) {
  List list({"10.0.0.1", "10.0.0.2", "10.0.0.3"});
  char second[] = "10.0.0.2";
  EXPECT_FALSE(isValidIPAddressInList(second, list.entries(), -1));
  EXPECT_FALSE(isValidIPAddressInList(second, list.entries(), 0));
  EXPECT_FALSE(isValidIPAddressInList(second, list.entries(), 1));
  EXPECT_TRUE(isValidIPAddressInList(second, list.entries(), 2));
  EXPECT_TRUE(isValidIPAddressInList(second, list.entries(), 3));
}

TEST(AddressInList, OfNoEntriesIsNotRead) {
  const Records records;
  char address[] = "10.0.0.1";
  char** const unreadable = reinterpret_cast<char**>(16);
  EXPECT_FALSE(isValidIPAddressInList(address, unreadable, 0));
  EXPECT_THAT(records.trail(),
              ElementsAre("> isValidIPAddressInList", "< isValidIPAddressInList 0"));
}

}  // namespace
