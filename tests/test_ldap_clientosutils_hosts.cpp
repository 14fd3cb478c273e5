#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "ldap_clientosutils.h"
#include "records.h"
#include "test_ldap_clientosutils.h"
#include "world.h"

using testing::ElementsAre;

namespace {

constexpr int kBlockBytes = 1024;
constexpr int kWorkBytes = 992;
static_assert(sizeof(hostent) + kWorkBytes == kBlockBytes);

// ---- vra_gethostbyname, vra_gethostbyaddr ----

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

// Still a success, with whatever the resolver left in the structure.
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

TEST(GetHost, GivesTheResolverAllOfTheBlockAfterTheStructureToWorkIn) {
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
  for (size_t used = 0; used < bytes; used += 16) line += " a234567";  // 8 characters and a pointer
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

// The switch is a number and independent of tracing.
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

}  // namespace
