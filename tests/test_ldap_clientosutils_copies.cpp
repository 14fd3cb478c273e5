#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldap_clientosutils.h"
#include "records.h"
#include "test_ldap_clientosutils.h"

namespace {

// ---- calcHostentSize, copyHostent ----

// A host entry that owns its strings.
class Host {
 public:
  Host(const char* name, std::vector<std::string> aliases, std::vector<std::string> addresses)
      : aliases_(std::move(aliases)), addresses_(std::move(addresses)), entry_() {
    if (name != nullptr) name_ = name;
    for (std::string& alias : aliases_) alias_pointers_.push_back(alias.data());
    alias_pointers_.push_back(nullptr);
    for (std::string& address : addresses_) address_pointers_.push_back(address.data());
    address_pointers_.push_back(nullptr);
    entry_.h_name = name != nullptr ? name_.data() : nullptr;
    entry_.h_aliases = alias_pointers_.data();
    entry_.h_addrtype = AF_INET;
    entry_.h_length = 4;
    entry_.h_addr_list = address_pointers_.data();
  }
  Host(const Host&) = delete;
  Host& operator=(const Host&) = delete;

  hostent* operator->() { return &entry_; }
  hostent* get() { return &entry_; }

 private:
  std::string name_;
  std::vector<std::string> aliases_;
  std::vector<std::string> addresses_;
  std::vector<char*> alias_pointers_;
  std::vector<char*> address_pointers_;
  hostent entry_;
};

const std::string kTenOne("\x0A\0\0\x01", 4);

// Builds the expected contents of a block at `base` byte by byte.
class ExpectedBlock {
 public:
  explicit ExpectedBlock(const char* base) : base_(base), bytes_(sizeof(hostent), '\0') {}

  void string(const std::string& text) { bytes_ += text.substr(0, text.find('\0')) + '\0'; }
  void list(const std::vector<std::string>& texts) {
    size_t position = bytes_.size() + (texts.size() + 1) * 8;
    for (const std::string& text : texts) {
      bytes_ += asBytes(base_ + position);
      position += std::min(text.find('\0'), text.size()) + 1;
    }
    bytes_ += std::string(8, '\0');
    for (const std::string& text : texts) string(text);
  }
  size_t position() const { return bytes_.size(); }
  void structure(size_t aliases, size_t addresses, int type, int length) {
    bytes_.replace(0, sizeof(hostent),
                   asBytes(base_ + sizeof(hostent)) + asBytes(base_ + aliases) + asBytes(type) +
                       asBytes(length) + asBytes(base_ + addresses));
  }
  const std::string& bytes() const { return bytes_; }

 private:
  template <typename T>
  static std::string asBytes(T value) {
    return std::string(reinterpret_cast<const char*>(&value), sizeof value);
  }

  const char* base_;
  std::string bytes_;
};

std::string expectedBytes(const char* base, const std::string& name,
                          const std::vector<std::string>& aliases,
                          const std::vector<std::string>& addresses) {
  ExpectedBlock expected(base);
  expected.string(name);
  const size_t alias_list = expected.position();
  expected.list(aliases);
  const size_t address_list = expected.position();
  expected.list(addresses);
  expected.structure(alias_list, address_list, AF_INET, 4);
  return expected.bytes();
}

// A block of exactly this size, filled with a byte that the entries do not contain.
class Block {
 public:
  explicit Block(size_t size) : bytes_(static_cast<char*>(malloc(size))), size_(size) {
    memset(bytes_, 0x5A, size);
  }
  ~Block() { free(bytes_); }
  Block(const Block&) = delete;
  Block& operator=(const Block&) = delete;

  hostent* entry() { return reinterpret_cast<hostent*>(bytes_); }
  const char* base() const { return bytes_; }
  std::string bytes() const { return std::string(bytes_, size_); }

 private:
  char* bytes_;
  size_t size_;
};

size_t sizeOf(hostent* entry) { return static_cast<size_t>(calcHostentSize(entry)); }

TEST(HostentSize, OfNothingIsNothing) { EXPECT_EQ(calcHostentSize(nullptr), 0); }

TEST(HostentSize, CountsTheStructureTheStringsAndTheArrays) {
  const struct {
    const char* name;
    std::vector<std::string> aliases;
    std::vector<std::string> addresses;
    int size;
  } cases[] = {
      {"h", {}, {kTenOne}, 60},
      {"", {}, {}, 32 + 1 + 8 + 8},
      {nullptr, {}, {}, 32 + 8 + 8},
      {"server", {}, {}, 32 + 7 + 8 + 8},
      {"server", {"one", "three", ""}, {}, 32 + 7 + (4 + 8) + (6 + 8) + (1 + 8) + 8 + 8},
      {"h", {}, {std::string("\0\0\0\0", 4)}, 32 + 2 + 8 + (1 + 8) + 8},
      {"h", {}, {"\xC0\xA8\x01\x02", kTenOne}, 32 + 2 + 8 + (5 + 8) + (2 + 8) + 8},
      {nullptr, {"a"}, {"0123456789abcdef"}, 32 + (2 + 8) + 8 + (17 + 8) + 8},
  };
  for (const auto& [name, aliases, addresses, size] : cases) {
    Host host(name, aliases, addresses);
    EXPECT_EQ(calcHostentSize(host.get()), size);
  }
}

TEST(HostentSize, TakesNullArraysAsEmpty) {
  Host host("server", {"one"}, {kTenOne});
  host->h_aliases = nullptr;
  EXPECT_EQ(calcHostentSize(host.get()), 32 + 7 + 8 + (2 + 8) + 8);
  host->h_addr_list = nullptr;
  EXPECT_EQ(calcHostentSize(host.get()), 32 + 7 + 8 + 8);
}

TEST(CopyHostent, RefusesNullPointers) {
  Host host("server", {"one"}, {kTenOne});
  Block block(sizeOf(host.get()));
  const std::string before = block.bytes();

  EXPECT_EQ(copyHostent(nullptr, block.entry()), 1);
  EXPECT_EQ(copyHostent(host.get(), nullptr), 1);
  EXPECT_EQ(copyHostent(nullptr, nullptr), 1);

  EXPECT_EQ(block.bytes(), before);
}

TEST(CopyHostent, StoresAnAddressUpToItsFirstZeroByte) {
  Host host("h", {}, {kTenOne});
  Block block(60);

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  EXPECT_EQ(block.bytes().substr(58), std::string("\x0A\0", 2));
}

// Names of every length modulo the alignment, so that the arrays start at every alignment.
TEST(CopyHostent, FillsTheBlockWithoutPadding) {
  const std::vector<std::string> aliases = {"one", "", "alias number three"};
  const std::vector<std::string> addresses = {kTenOne, "\xC0\xA8\x01\x02",
                                              std::string("\0\x01", 2)};
  for (size_t length = 0; length <= 16; ++length) {
    SCOPED_TRACE(length);
    const std::string name(length, 'n');
    Host host(name.c_str(), aliases, addresses);
    Block block(sizeOf(host.get()));
    const LiveAllocations live;

    EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

    EXPECT_EQ(live.blocks(), 0);
    EXPECT_EQ(block.bytes(), expectedBytes(block.base(), name, aliases, addresses));
  }
}

TEST(CopyHostent, WithoutAliasesAndAddresses) {
  Host host("server", {}, {});
  Block block(sizeOf(host.get()));

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  EXPECT_EQ(block.bytes(), expectedBytes(block.base(), "server", {}, {}));
}

TEST(CopyHostent, TakesNullArraysAsEmpty) {
  Host host("server", {"one"}, {kTenOne});
  host->h_aliases = nullptr;
  host->h_addr_list = nullptr;
  Block block(sizeOf(host.get()));

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  EXPECT_EQ(block.bytes(), expectedBytes(block.base(), "server", {}, {}));
}

TEST(CopyHostent, WritesOneByteMoreThanTheSizeForANullName) {
  Host host(nullptr, {"one"}, {kTenOne});
  Block block(sizeOf(host.get()) + 1);

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  const std::string expected = expectedBytes(block.base(), "", {"one"}, {kTenOne});
  EXPECT_EQ(expected.size(), sizeOf(host.get()) + 1);
  EXPECT_EQ(block.bytes(), expected);
  EXPECT_STREQ(block.entry()->h_name, "");
}

TEST(CopyHostent, LeavesTheBytesAfterTheCopyAlone) {
  Host host("server", {"one"}, {kTenOne});
  const size_t size = sizeOf(host.get());
  Block block(size + 16);

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  EXPECT_EQ(block.bytes().substr(size), std::string(16, '\x5A'));
}

TEST(CopyHostent, KeepsTheTypeAndTheLengthAsTheyAre) {
  Host host("server", {}, {kTenOne});
  host->h_addrtype = -17;
  host->h_length = 1234567;
  Block block(sizeOf(host.get()));

  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);

  EXPECT_EQ(block.entry()->h_addrtype, -17);
  EXPECT_EQ(block.entry()->h_length, 1234567);
}

TEST(CopyHostent, CopiesACopyWhoseArraysAreNotAligned) {
  const std::vector<std::string> aliases = {"one", "three"};
  Host host("server", aliases, {kTenOne});  // the arrays start at odd offsets from 39 on
  Block first(sizeOf(host.get()));
  ASSERT_EQ(copyHostent(host.get(), first.entry()), 0);
  ASSERT_NE(reinterpret_cast<uintptr_t>(first.entry()->h_aliases) % alignof(char*), 0U);

  ASSERT_EQ(sizeOf(first.entry()), sizeOf(host.get()));
  Block second(sizeOf(first.entry()));
  EXPECT_EQ(copyHostent(first.entry(), second.entry()), 0);

  EXPECT_EQ(second.bytes(), expectedBytes(second.base(), "server", aliases, {kTenOne}));
}

TEST(CopyHostent, WritesToABlockThatIsNotAligned) {
  Host host("server", {"one"}, {kTenOne});
  const size_t size = sizeOf(host.get());
  Block block(size + 1);
  char* const base = reinterpret_cast<char*>(block.entry()) + 1;

  EXPECT_EQ(copyHostent(host.get(), reinterpret_cast<hostent*>(base)), 0);

  EXPECT_EQ(block.bytes().substr(1), expectedBytes(base, "server", {"one"}, {kTenOne}));
}

TEST(CopyHostent, ReadsAStructureThatIsNotAligned) {
  Host host("server", {"one"}, {kTenOne});
  const size_t size = sizeOf(host.get());
  for (size_t shift = 1; shift < alignof(hostent); ++shift) {
    SCOPED_TRACE(shift);
    Block source(shift + sizeof(hostent));
    char* const base = reinterpret_cast<char*>(source.entry()) + shift;
    memcpy(base, reinterpret_cast<const char*>(host.get()), sizeof(hostent));
    hostent* const unaligned = reinterpret_cast<hostent*>(base);
    Block block(size);

    EXPECT_EQ(sizeOf(unaligned), size);
    EXPECT_EQ(copyHostent(unaligned, block.entry()), 0);

    EXPECT_EQ(block.bytes(), expectedBytes(block.base(), "server", {"one"}, {kTenOne}));
  }
}

TEST(CopyHostent, CopiesWhatALookUpGave) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server one two\n", [] {
    const HostAnswer answer = byName("server");
    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    Block block(sizeOf(answer.entry.get()));

    EXPECT_EQ(copyHostent(answer.entry.get(), block.entry()), 0);

    EXPECT_EQ(block.bytes(), expectedBytes(block.base(), "server", {"one", "two"}, {kTenOne}));
  });
}

TEST(CopyHostent, AndTheSizeWriteNothing) {
  const Records records;
  const DebugSwitch debug(1);
  Host host("server", {}, {});
  Block block(sizeOf(host.get()));

  EXPECT_EQ(calcHostentSize(nullptr), 0);
  EXPECT_EQ(copyHostent(host.get(), block.entry()), 0);
  EXPECT_EQ(copyHostent(nullptr, nullptr), 1);

  expectNothingWritten(records);
}

}  // namespace
