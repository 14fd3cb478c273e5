#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldap_clientosutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::Field;
using testing::IsEmpty;

namespace {

constexpr unsigned int kErrorLevel = 0xC8110000;
constexpr int kBlockBytes = 1024;
constexpr int kWorkBytes = 992;
static_assert(sizeof(hostent) + kWorkBytes == kBlockBytes);

#define REQUIRE_HOSTS() REQUIRE_ROOT("for a private /etc with its own hosts")

// The platform's debug switch, off again at the end of the scope.
class DebugSwitch {
 public:
  explicit DebugSwitch(int answer) { readLdapDebugAnswer = answer; }
  ~DebugSwitch() { readLdapDebugAnswer = 0; }
  DebugSwitch(const DebugSwitch&) = delete;
  DebugSwitch& operator=(const DebugSwitch&) = delete;
};

// One print of this text at the error level, and no trace record.
void expectPrint(const Records& records, const std::string& text) {
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(),
              ElementsAre(AllOf(Field(&Print::level, kErrorLevel), Field(&Print::text, text))));
}

void expectNothingWritten(const Records& records) {
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

// Runs the body in a child process that knows these hosts and services and no others.
void withHosts(std::string_view hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/hosts", hosts);
              writeFile("/etc/services", "post 25/tcp\n");
              body();
              return 0;
            }),
            0);
}

sockaddr_in socketAddress(const char* address, uint16_t port) {
  sockaddr_in made = {};
  made.sin_family = AF_INET;
  made.sin_port = htons(port);
  EXPECT_EQ(inet_pton(AF_INET, address, &made.sin_addr), 1);
  return made;
}

struct NameAnswer {
  int rc;
  std::string host;
  std::string serv;
};

char untouched_text[] = "untouched";

std::string taken(char* text) {
  if (text == nullptr) return "(null)";
  std::string copy = text;
  if (text != untouched_text) free(text);
  return copy;
}

NameAnswer nameInfo(const sockaddr_in& address, bool with_host = true, bool with_serv = true) {
  char* host = untouched_text;
  char* serv = untouched_text;
  const int rc = vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), sizeof address,
                                 with_host ? &host : nullptr, with_serv ? &serv : nullptr);
  return {rc, taken(host), taken(serv)};
}

void expectAnswer(const NameAnswer& answer, int rc, const std::string& host,
                  const std::string& serv) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.host, host);
  EXPECT_EQ(answer.serv, serv);
}

// ---- vra_getnameinfo ----

TEST(GetNameInfo, RefusesANullAddressAnEmptyOneAndNoOutputs) {
  const Records records;
  const DebugSwitch debug(1);
  const sockaddr_in address = socketAddress("10.0.0.1", 25);
  const auto* const generic = reinterpret_cast<const sockaddr*>(&address);
  char* host = untouched_text;
  char* serv = untouched_text;

  EXPECT_EQ(vra_getnameinfo(nullptr, sizeof address, &host, &serv), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_getnameinfo(generic, 0, &host, &serv), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_getnameinfo(generic, sizeof address, nullptr, nullptr), OSUTILS_PARAM_ERROR);

  EXPECT_EQ(host, untouched_text);
  EXPECT_EQ(serv, untouched_text);
  expectNothingWritten(records);
}

TEST(GetNameInfo, GivesTheHostAndTheServiceByName) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server alias\n", [] {
    const Records records;
    const DebugSwitch debug(1);
    const LiveAllocations live;

    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, "server", "post");

    EXPECT_EQ(live.blocks(), 0);  // both were the caller's
    expectNothingWritten(records);
  });
}

TEST(GetNameInfo, GivesNumbersForWhatHasNoName) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.2", 26)), OSUTILS_SUCCESS, "10.0.0.2", "26");
  });
}

TEST(GetNameInfo, GivesTheHostAlone) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), true, false), OSUTILS_SUCCESS, "server",
                 "untouched");
  });
}

TEST(GetNameInfo, GivesTheServiceAlone) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), false, true), OSUTILS_SUCCESS, "untouched",
                 "post");
  });
}

TEST(GetNameInfo, TakesAnAddressOfTheOtherFamily) {
  REQUIRE_HOSTS();
  withHosts("2001:db8::1 six\n", [] {
    sockaddr_in6 address = {};
    address.sin6_family = AF_INET6;
    address.sin6_port = htons(25);
    ASSERT_EQ(inet_pton(AF_INET6, "2001:db8::1", &address.sin6_addr), 1);
    char* host = nullptr;

    EXPECT_EQ(vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), sizeof address, &host,
                              nullptr),
              OSUTILS_SUCCESS);

    EXPECT_EQ(taken(host), "six");
  });
}

TEST(GetNameInfo, HasRoomForAHostNameOf1024Characters) {
  REQUIRE_HOSTS();
  const std::string longest(1024, 'h');
  withHosts("10.0.0.1 " + longest + "\n10.0.0.2 " + longest + "h\n", [&] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, longest, "post");
    expectAnswer(nameInfo(socketAddress("10.0.0.2", 25)), OSUTILS_OPERATIONS_ERROR, "(null)",
                 "(null)");
  });
}

TEST(GetNameInfo, HasRoomForAServiceNameOf31Characters) {
  REQUIRE_HOSTS();
  const std::string longest(31, 's');
  withHosts("10.0.0.1 server\n", [&] {
    writeFile("/etc/services", longest + " 25/tcp\n" + longest + "s 26/tcp\n");
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, "server", longest);
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 26)), OSUTILS_OPERATIONS_ERROR, "(null)",
                 "(null)");
  });
}

TEST(GetNameInfo, PrintsErrnoAndNotTheAnswerOfAFailedLookUp) {
  const Records records;
  const DebugSwitch debug(1);
  const LiveAllocations live;
  const FailingCall look_up(Call::getnameinfo, EAI_FAIL);
  errno = 1234;

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_OPERATIONS_ERROR, "(null)",
               "(null)");

  EXPECT_TRUE(look_up.fired());
  EXPECT_EQ(live.blocks(), 0);
  expectPrint(records, "vra_getnameinfo: getnameinfo failed with errno 1234\n");
}

TEST(GetNameInfo, FailsForAnAddressThatIsTooShort) {
  const DebugSwitch debug(0);
  const Records records;
  const LiveAllocations live;
  const sockaddr_in address = socketAddress("10.0.0.1", 25);
  char* host = untouched_text;
  char* serv = untouched_text;

  EXPECT_EQ(vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), 1, &host, &serv),
            OSUTILS_OPERATIONS_ERROR);

  EXPECT_EQ(host, nullptr);
  EXPECT_EQ(serv, nullptr);
  EXPECT_EQ(live.blocks(), 0);
  expectNothingWritten(records);  // the switch is off
}

TEST(GetNameInfo, FailsWithOneOutputAlone) {
  const DebugSwitch debug(1);
  const LiveAllocations live;
  for (const bool with_host : {true, false}) {
    SCOPED_TRACE(with_host);
    const Records records;
    const FailingCall look_up(Call::getnameinfo, EAI_AGAIN);
    errno = 7;

    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), with_host, !with_host),
                 OSUTILS_OPERATIONS_ERROR, with_host ? "(null)" : "untouched",
                 with_host ? "untouched" : "(null)");

    expectPrint(records, "vra_getnameinfo: getnameinfo failed with errno 7\n");
  }
  EXPECT_EQ(live.blocks(), 0);
}

TEST(GetNameInfo, WithoutMemoryForTheHost) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  const DebugSwitch debug(1);
  const LiveAllocations live;
  const FailingCall look_up(Call::getnameinfo, EAI_FAIL);
  const FailingCall allocation(Call::allocation, ENOMEM, 1);

  // The service's output is not reached.
  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_NO_MEMORY, "(null)", "untouched");

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(look_up.calls(), 0);
  EXPECT_EQ(live.blocks(), 0);
  expectNothingWritten(records);
}

TEST(GetNameInfo, WithoutMemoryForTheServiceReleasesTheHost) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  const DebugSwitch debug(1);
  const LiveAllocations live;
  const FailingCall look_up(Call::getnameinfo, EAI_FAIL);
  const FailingCall allocation(Call::allocation, ENOMEM, 2);

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_NO_MEMORY, "(null)", "(null)");

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(look_up.calls(), 0);
  EXPECT_EQ(live.blocks(), 0);
  expectNothingWritten(records);
}

TEST(GetNameInfo, WithoutMemoryForTheServiceAlone) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  const FailingCall allocation(Call::allocation, ENOMEM, 1);

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), false, true), OSUTILS_NO_MEMORY, "untouched",
               "(null)");

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(live.blocks(), 0);
}

// ---- vra_gethostbyname, vra_gethostbyaddr ----

struct FreeBlock {
  void operator()(hostent* block) const { free(block); }
};

struct HostAnswer {
  int rc;
  std::unique_ptr<hostent, FreeBlock> entry;
  int size;
};

hostent untouched_entry;

HostAnswer byName(const char* name) {
  hostent* entry = &untouched_entry;
  int size = 4711;
  const int rc = vra_gethostbyname(name, &entry, &size);
  EXPECT_NE(entry, &untouched_entry);
  return {rc, std::unique_ptr<hostent, FreeBlock>(entry), size};
}

HostAnswer byAddress(int family, const char* text) {
  char address[sizeof(in6_addr)];
  EXPECT_EQ(inet_pton(family, text, address), 1);
  const socklen_t length = family == AF_INET ? sizeof(in_addr) : sizeof(in6_addr);
  hostent* entry = &untouched_entry;
  int size = 4711;
  const int rc = vra_gethostbyaddr(address, length, family, &entry, &size);
  EXPECT_NE(entry, &untouched_entry);
  return {rc, std::unique_ptr<hostent, FreeBlock>(entry), size};
}

void expectNoEntry(const HostAnswer& answer, int rc) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.entry, nullptr);
  EXPECT_EQ(answer.size, 0);
}

std::vector<std::string> addressesIn(const HostAnswer& answer) {
  std::vector<std::string> texts;
  for (char** address = answer.entry->h_addr_list; *address != nullptr; ++address) {
    char text[INET6_ADDRSTRLEN];
    EXPECT_NE(inet_ntop(answer.entry->h_addrtype, *address, text, sizeof text), nullptr);
    texts.push_back(text);
  }
  return texts;
}

std::vector<std::string> aliasesIn(const HostAnswer& answer) {
  std::vector<std::string> texts;
  for (char** alias = answer.entry->h_aliases; *alias != nullptr; ++alias) texts.push_back(*alias);
  return texts;
}

void expectAllInBlock(const HostAnswer& answer) {
  ASSERT_GE(malloc_usable_size(answer.entry.get()), size_t{kBlockBytes});
  const char* const begin = reinterpret_cast<const char*>(answer.entry.get());
  const auto inBlock = [begin](const void* pointer, size_t size) {
    const char* const at = static_cast<const char*>(pointer);
    return at >= begin + sizeof(hostent) && at + size <= begin + kBlockBytes;
  };
  const auto endsInBlock = [&](const char* text) {
    return inBlock(text, 1) &&
           memchr(text, '\0', static_cast<size_t>(begin + kBlockBytes - text)) != nullptr;
  };
  const auto entriesInBlock = [&](char** list, const auto& isInBlock) {
    for (;; ++list) {
      if (!inBlock(list, sizeof *list)) return false;
      if (*list == nullptr) return true;
      if (!isInBlock(*list)) return false;
    }
  };
  EXPECT_TRUE(endsInBlock(answer.entry->h_name));
  EXPECT_TRUE(entriesInBlock(answer.entry->h_aliases, endsInBlock));
  EXPECT_TRUE(entriesInBlock(answer.entry->h_addr_list, [&](const char* address) {
    return inBlock(address, static_cast<size_t>(answer.entry->h_length));
  }));
}

TEST(GetHost, RefusesNullOutputs) {
  const Records records;
  const DebugSwitch debug(1);
  const in_addr address = {};
  hostent* entry = &untouched_entry;
  int size = 4711;

  EXPECT_EQ(vra_gethostbyname("server", nullptr, &size), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_gethostbyname("server", &entry, nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_gethostbyname(nullptr, nullptr, nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_gethostbyaddr(&address, sizeof address, AF_INET, nullptr, &size),
            OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_gethostbyaddr(&address, sizeof address, AF_INET, &entry, nullptr),
            OSUTILS_PARAM_ERROR);

  EXPECT_EQ(entry, &untouched_entry);
  EXPECT_EQ(size, 4711);
  expectNothingWritten(records);
}

TEST(GetHost, ByNameGivesTheEntryInOneBlock) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server one two three\n10.0.0.2 other\n", [] {
    const Records records;
    const DebugSwitch debug(1);
    const LiveAllocations live;

    const HostAnswer answer = byName("server");

    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_EQ(answer.size, kBlockBytes);
    EXPECT_STREQ(answer.entry->h_name, "server");
    EXPECT_THAT(aliasesIn(answer), ElementsAre("one", "two", "three"));
    EXPECT_EQ(answer.entry->h_addrtype, AF_INET);
    EXPECT_EQ(answer.entry->h_length, 4);
    EXPECT_THAT(addressesIn(answer), ElementsAre("10.0.0.1"));
    expectAllInBlock(answer);
    EXPECT_EQ(live.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
    expectNothingWritten(records);
  });
}

TEST(GetHost, ByNameFindsAnAlias) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server one two three\n", [] {
    const HostAnswer answer = byName("two");
    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_STREQ(answer.entry->h_name, "server");
  });
}

TEST(GetHost, ByNameTakesAnAddressForAName) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    const HostAnswer answer = byName("10.3.2.1");
    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_STREQ(answer.entry->h_name, "10.3.2.1");
    EXPECT_THAT(addressesIn(answer), ElementsAre("10.3.2.1"));
    expectAllInBlock(answer);
  });
}

TEST(GetHost, ByAddressGivesTheEntryInOneBlock) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server one two three\n10.0.0.2 other\n", [] {
    const Records records;
    const DebugSwitch debug(1);
    const LiveAllocations live;

    const HostAnswer answer = byAddress(AF_INET, "10.0.0.1");

    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_EQ(answer.size, kBlockBytes);
    EXPECT_STREQ(answer.entry->h_name, "server");
    EXPECT_THAT(aliasesIn(answer), ElementsAre("one", "two", "three"));
    EXPECT_THAT(addressesIn(answer), ElementsAre("10.0.0.1"));
    expectAllInBlock(answer);
    EXPECT_EQ(live.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
    expectNothingWritten(records);
  });
}

TEST(GetHost, ByAddressOfTheOtherFamily) {
  REQUIRE_HOSTS();
  withHosts("2001:db8::1 six\n2001:db8::2 seven\n", [] {
    const HostAnswer answer = byAddress(AF_INET6, "2001:db8::2");
    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_STREQ(answer.entry->h_name, "seven");
    EXPECT_EQ(answer.entry->h_addrtype, AF_INET6);
    EXPECT_EQ(answer.entry->h_length, 16);
    EXPECT_THAT(addressesIn(answer), ElementsAre("2001:db8::2"));
  });
}

// A success all the same, whatever the resolver has left in the structure.
TEST(GetHost, ThatIsNotFoundIsTheStructureAsTheResolverLeftIt) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server one two three\n", [] {
    const Records records;
    const DebugSwitch debug(1);
    hostent structure;
    hostent* found = &structure;
    char buffer[kWorkBytes];
    int error = 0;
    ASSERT_EQ(gethostbyname_r("unknown", &structure, buffer, sizeof buffer, &found, &error), 0);
    ASSERT_EQ(found, nullptr);

    const HostAnswer answer = byName("unknown");

    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_EQ(answer.size, kBlockBytes);
    EXPECT_STREQ(answer.entry->h_name, structure.h_name);
    expectNothingWritten(records);
  });
}

TEST(GetHost, ThatIsNotFoundWhereTheResolverFillsNothingIsAnEmptyEntry) {
  REQUIRE_HOSTS();
  withHosts("", [] {
    const Records records;
    const DebugSwitch debug(1);
    HostAnswer answers[] = {byName("unknown"), byAddress(AF_INET, "10.0.0.2"),
                            byAddress(AF_INET6, "2001:db8::2")};
    for (const HostAnswer& answer : answers) {
      ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
      EXPECT_EQ(answer.size, kBlockBytes);
      EXPECT_EQ(answer.entry->h_name, nullptr);
      EXPECT_EQ(answer.entry->h_aliases, nullptr);
      EXPECT_EQ(answer.entry->h_addrtype, 0);
      EXPECT_EQ(answer.entry->h_length, 0);
      EXPECT_EQ(answer.entry->h_addr_list, nullptr);
    }
    expectNothingWritten(records);
  });
}

TEST(GetHost, GivesTheResolverAllOfTheBlockBehindTheStructureToWorkIn) {
  for (const Call resolver : {Call::gethostbyname_r, Call::gethostbyaddr_r}) {
    SCOPED_TRACE(resolver == Call::gethostbyname_r ? "by name" : "by address");
    passed = {};
    size_t block_size = 0;
    const BeforeCall look(resolver, [&] { block_size = malloc_usable_size(passed.work.entry); });
    const FailingCall fails(resolver, NO_RECOVERY);

    if (resolver == Call::gethostbyname_r) {
      expectNoEntry(byName("server"), NO_RECOVERY);
    } else {
      expectNoEntry(byAddress(AF_INET, "10.0.0.1"), NO_RECOVERY);
    }

    ASSERT_TRUE(look.fired());
    EXPECT_GE(block_size, size_t{kBlockBytes});
    EXPECT_EQ(passed.work.offset, 32);
    EXPECT_EQ(passed.work.size, size_t{kWorkBytes});
  }
}

// A line of the hosts file whose entry needs about `bytes` bytes of the work buffer.
std::string lineWithAliases(size_t bytes) {
  std::string line = "10.0.0.1 server";
  for (size_t used = 0; used < bytes; used += 16) line += " a234567";  // with its pointer
  return line + "\n";
}

TEST(GetHost, WhoseAnswerDoesNotFitFailsAndIsNotTriedAgain) {
  REQUIRE_HOSTS();
  withHosts(lineWithAliases(kWorkBytes + 100), [] {
    const DebugSwitch debug(1);
    const LiveAllocations live;
    {
      const Records records;
      const FailingCall look_ups(Call::gethostbyname_r, 0, kNever);
      expectNoEntry(byName("server"), NETDB_INTERNAL);
      EXPECT_EQ(look_ups.calls(), 1);
      expectPrint(records, "Error - vra_gethostbyname: gethostbyname_r failed, errno=-1\n ");
    }
    {
      const Records records;
      const FailingCall look_ups(Call::gethostbyaddr_r, 0, kNever);
      expectNoEntry(byAddress(AF_INET, "10.0.0.1"), NETDB_INTERNAL);
      EXPECT_EQ(look_ups.calls(), 1);
      expectPrint(records, "Error - vra_gethostbyaddr: gethostbyaddr_r failed, errno=-1\n ");
    }
    EXPECT_EQ(live.blocks(), 0);
  });
}

TEST(GetHost, WhoseAnswerNearlyFillsTheBlockIsGiven) {
  REQUIRE_HOSTS();
  withHosts(lineWithAliases(700), [] {
    const HostAnswer answer = byName("server");
    ASSERT_EQ(answer.rc, OSUTILS_SUCCESS);
    EXPECT_EQ(aliasesIn(answer).size(), 44U);
    expectAllInBlock(answer);
  });
}

TEST(GetHost, WithoutAReachableNameServerGivesTheResolversCode) {
  REQUIRE_HOSTS();
  EXPECT_EQ(withPrivateNetwork([] {
              writeFile("/etc/nsswitch.conf", "hosts: dns\n");
              writeFile("/etc/resolv.conf", "nameserver 192.0.2.1\noptions attempts:1\n");
              const Records records;
              const DebugSwitch debug(1);
              const LiveAllocations live;

              expectNoEntry(byName("server"), TRY_AGAIN);

              EXPECT_EQ(live.blocks(), 0);
              expectPrint(records, "Error - vra_gethostbyname: gethostbyname_r failed, errno=2\n ");
              return 0;
            }),
            0);
}

TEST(GetHost, ThatFailsGivesTheResolversCode) {
  const DebugSwitch debug(1);
  const LiveAllocations live;
  for (const int code : {HOST_NOT_FOUND, TRY_AGAIN, NO_RECOVERY, NO_DATA, NETDB_INTERNAL}) {
    SCOPED_TRACE(code);
    {
      const Records records;
      const FailingCall look_up(Call::gethostbyname_r, code);
      expectNoEntry(byName("server"), code);
      EXPECT_TRUE(look_up.fired());
      expectPrint(records, "Error - vra_gethostbyname: gethostbyname_r failed, errno=" +
                               std::to_string(code) + "\n ");
    }
    {
      const Records records;
      const FailingCall look_up(Call::gethostbyaddr_r, code);
      expectNoEntry(byAddress(AF_INET, "10.0.0.1"), code);
      EXPECT_TRUE(look_up.fired());
      expectPrint(records, "Error - vra_gethostbyaddr: gethostbyaddr_r failed, errno=" +
                               std::to_string(code) + "\n ");
    }
  }
  EXPECT_EQ(live.blocks(), 0);
}

TEST(GetHost, ThatFailsPrintsNothingWhileTheSwitchIsOff) {
  const Records records;
  const DebugSwitch debug(0);
  const FailingCall name_look_up(Call::gethostbyname_r, NO_RECOVERY);
  const FailingCall address_look_up(Call::gethostbyaddr_r, NO_RECOVERY);

  expectNoEntry(byName("server"), NO_RECOVERY);
  expectNoEntry(byAddress(AF_INET, "10.0.0.1"), NO_RECOVERY);

  expectNothingWritten(records);
}

// The switch is a number, and tracing has nothing to do with it.
TEST(GetHost, ThatFailsPrintsWithoutTracing) {
  const Records records(0);
  const DebugSwitch debug(-1);
  const FailingCall look_up(Call::gethostbyname_r, NO_RECOVERY);

  expectNoEntry(byName("server"), NO_RECOVERY);

  expectPrint(records, "Error - vra_gethostbyname: gethostbyname_r failed, errno=3\n ");
}

TEST(GetHost, WithoutMemoryHasATextOfItsOwnForEachLookUp) {
  REQUIRE_OWN_MALLOC();
  const DebugSwitch debug(1);
  {
    const Records records;
    const FailingCall allocation(Call::allocation, ENOMEM);
    const FailingCall look_up(Call::gethostbyname_r, NO_RECOVERY);
    expectNoEntry(byName("server"), OSUTILS_NO_MEMORY);
    EXPECT_TRUE(allocation.fired());
    EXPECT_EQ(look_up.calls(), 0);
    expectPrint(records, "Error - vra_gethostbyname: malloc failed. \n");
  }
  {
    const Records records;
    const FailingCall allocation(Call::allocation, ENOMEM);
    const FailingCall look_up(Call::gethostbyaddr_r, NO_RECOVERY);
    expectNoEntry(byAddress(AF_INET, "10.0.0.1"), OSUTILS_NO_MEMORY);
    EXPECT_TRUE(allocation.fired());
    EXPECT_EQ(look_up.calls(), 0);
    expectPrint(records, "Error - vra_gethostbyaddr: malloc failed\n");
  }
}

TEST(GetHost, WithoutMemoryPrintsNothingWhileTheSwitchIsOff) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  const DebugSwitch debug(0);
  const FailingCall allocation(Call::allocation, ENOMEM, 1, 2);

  expectNoEntry(byName("server"), OSUTILS_NO_MEMORY);
  expectNoEntry(byAddress(AF_INET, "10.0.0.1"), OSUTILS_NO_MEMORY);

  expectNothingWritten(records);
}

TEST(GetHost, InManyThreadsGivesEachItsOwnAnswer) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server1\n10.0.0.2 server2\n10.0.0.3 server3\n10.0.0.4 server4\n", [] {
    std::vector<std::thread> threads;
    for (int i = 1; i <= 4; ++i) {
      threads.emplace_back([i] {
        const std::string name = "server" + std::to_string(i);
        const std::string address = "10.0.0." + std::to_string(i);
        for (int round = 0; round < 100; ++round) {
          const HostAnswer by_name = byName(name.c_str());
          const HostAnswer by_address = byAddress(AF_INET, address.c_str());
          ASSERT_EQ(by_name.rc, OSUTILS_SUCCESS);
          ASSERT_EQ(by_address.rc, OSUTILS_SUCCESS);
          ASSERT_THAT(addressesIn(by_name), ElementsAre(address));
          ASSERT_EQ(by_address.entry->h_name, name);
          ASSERT_EQ(nameInfo(socketAddress(address.c_str(), 25)).host, name);
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
  });
}

// ---- calcHostentSize, copyHostent ----

// A host entry over strings of its own.
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

// What a block at `base` must hold, put together byte by byte.
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

// A block of exactly this size, filled with something that is no part of an answer.
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

// Names of every length modulo the alignment, so that the arrays begin everywhere.
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

TEST(CopyHostent, LeavesTheBytesBehindTheCopyAlone) {
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
  Host host("server", aliases, {kTenOne});  // the arrays begin at 39 and further odd places
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
