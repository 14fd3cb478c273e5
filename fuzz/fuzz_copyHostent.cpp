// copyHostent and calcHostentSize with any host entry. The copy is walked part by part, also after
// the source is gone, and then copied itself.
#include <netdb.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "fuzz.h"
#include "input.h"
#include "ldap_clientosutils.h"

namespace {

using List = std::optional<std::vector<std::string>>;

struct Host {
  std::optional<std::string> name;
  List aliases;
  List addresses;
  int type;
  int length;
};

Host hostFrom(Input& input) {
  const uint8_t missing = input.byte();
  const auto list = [&](uint8_t bit) {
    const uint8_t count = input.byte();
    if ((missing & bit) != 0) return List();
    List texts(std::in_place);
    for (uint8_t i = 0; i < count && !input.isAtEnd(); ++i) texts->push_back(input.text());
    return texts;
  };
  Host host;
  host.type = input.number<int>();
  host.length = input.number<int>();
  if ((missing & 1) == 0) host.name = input.text();
  host.aliases = list(2);
  host.addresses = list(4);
  return host;
}

// Memory of exactly this size, so that the sanitizer reports what is beyond it, at any alignment.
class Memory {
 public:
  Memory(size_t size, size_t offset) : all_(offset + size, '\xA5'), offset_(offset) {
    all_.shrink_to_fit();
  }
  ~Memory() { std::fill(all_.begin(), all_.end(), '\xFF'); }
  Memory(const Memory&) = delete;
  Memory& operator=(const Memory&) = delete;

  char* at() { return all_.data() + offset_; }
  const std::vector<char>& all() const { return all_; }

 private:
  std::vector<char> all_;
  size_t offset_;
};

// The host as a hostent whose parts are all apart.
class Source {
 public:
  Source(const Host& host, size_t offset) : offset_(offset) {
    hostent entry = {};
    if (host.name) entry.h_name = text(*host.name);
    entry.h_aliases = list(host.aliases);
    entry.h_addrtype = host.type;
    entry.h_length = host.length;
    entry.h_addr_list = list(host.addresses);
    memcpy(add(sizeof entry), &entry, sizeof entry);
  }

  hostent* entry() { return reinterpret_cast<hostent*>(parts_.back()->at()); }
  std::vector<std::vector<char>> contents() const {
    std::vector<std::vector<char>> all;
    for (const auto& part : parts_) all.push_back(part->all());
    return all;
  }

 private:
  char* add(size_t size) {
    parts_.push_back(std::make_unique<Memory>(size, offset_));
    return parts_.back()->at();
  }
  char* text(const std::string& value) {
    return static_cast<char*>(memcpy(add(value.size() + 1), value.c_str(), value.size() + 1));
  }
  char** list(const List& texts) {
    if (!texts) return nullptr;
    std::vector<char*> entries;
    for (const std::string& value : *texts) entries.push_back(text(value));
    entries.push_back(nullptr);
    const size_t size = entries.size() * sizeof(char*);
    return reinterpret_cast<char**>(memcpy(add(size), entries.data(), size));
  }

  size_t offset_;
  std::vector<std::unique_ptr<Memory>> parts_;
};

// Reads a copy from its first byte to its last.
class Walk {
 public:
  explicit Walk(const char* block) : block_(block), at_(block) {}

  size_t passed() const { return static_cast<size_t>(at_ - block_); }

  template <typename Value>
  Value take() {
    Value value;
    memcpy(&value, at_, sizeof value);
    at_ += sizeof value;
    return value;
  }
  void expectPointerHere(const char* what, const void* pointer) const {
    if (pointer != at_) {
      fail(what, std::to_string(static_cast<const char*>(pointer) - block_),
           std::to_string(at_ - block_) + " bytes after the beginning");
    }
  }
  void expectText(const char* what, const std::string& expected) {
    expectSame(what, std::string_view(at_, strlen(at_)), expected);
    at_ += expected.size() + 1;
  }
  void expectList(const char* what, const void* list, const List& texts) {
    static const std::vector<std::string> kNone;
    const std::vector<std::string>& expected = texts ? *texts : kNone;
    expectPointerHere(what, list);
    std::vector<const char*> entries;
    for (size_t i = 0; i < expected.size(); ++i) entries.push_back(take<const char*>());
    if (take<const char*>() != nullptr) fail(what, "goes on", "ends with a null pointer");
    for (size_t i = 0; i < expected.size(); ++i) {
      expectPointerHere(what, entries[i]);
      expectText(what, expected[i]);
    }
  }

 private:
  const char* block_;
  const char* at_;
};

void expectCopy(const char* block, const Host& host, size_t size) {
  Walk walk(block);
  const auto copy = walk.take<hostent>();
  expectSame("h_addrtype", copy.h_addrtype, host.type);
  expectSame("h_length", copy.h_length, host.length);
  walk.expectPointerHere("h_name", copy.h_name);
  walk.expectText("h_name", host.name.value_or(""));
  walk.expectList("h_aliases", copy.h_aliases, host.aliases);
  walk.expectList("h_addr_list", copy.h_addr_list, host.addresses);
  expectSame("the copy's bytes", static_cast<long>(walk.passed()), static_cast<long>(size));
}

long expectedSize(const Host& host) {
  long size = 32 + 8 + 8;
  if (host.name) size += static_cast<long>(host.name->size()) + 1;
  for (const List* const list : {&host.aliases, &host.addresses}) {
    if (!*list) continue;
    for (const std::string& text : **list) size += 8 + static_cast<long>(text.size()) + 1;
  }
  return size;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Input input(data, size);
  const uint8_t offsets = input.byte();
  const Host host = hostFrom(input);
  auto source = std::make_unique<Source>(host, offsets % 8);
  const std::vector<std::vector<char>> before = source->contents();

  const int reported = calcHostentSize(source->entry());
  expectSame("calcHostentSize", reported, expectedSize(host));
  expectSame("calcHostentSize(nullptr)", calcHostentSize(nullptr), 0);
  const size_t bytes = static_cast<size_t>(reported) + (host.name ? 0 : 1);

  auto first = std::make_unique<Memory>(bytes, offsets / 8 % 8);
  const std::vector<char> untouched = first->all();
  auto* const block = reinterpret_cast<hostent*>(first->at());
  expectSame("copyHostent without a source", copyHostent(nullptr, block), 1);
  expectSame("copyHostent without a block", copyHostent(source->entry(), nullptr), 1);
  if (first->all() != untouched) fail("copyHostent without a source", "wrote", "nothing");

  expectSame("copyHostent", copyHostent(source->entry(), block), 0);
  if (source->contents() != before) fail("copyHostent", "changed the source", "the same source");
  expectCopy(first->at(), host, bytes);
  source.reset();
  expectCopy(first->at(), host, bytes);

  // The copy's name is never null.
  expectSame("calcHostentSize of the copy", calcHostentSize(block), static_cast<long>(bytes));
  Memory second(bytes, offsets / 64);
  auto* const again = reinterpret_cast<hostent*>(second.at());
  expectSame("copyHostent of the copy", copyHostent(block, again), 0);
  first.reset();
  expectCopy(second.at(), host, bytes);
  return 0;
}
