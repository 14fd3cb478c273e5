#include <arpa/inet.h>
#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stddef.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <string>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_iputils.h"
#include "world.h"

using testing::ElementsAre;
using testing::UnorderedElementsAre;

// How many lists of the resolver were freed in this program.
std::atomic<int> released_resolver_lists = 0;

extern "C" __attribute__((visibility("default"))) void freeaddrinfo(addrinfo* list) noexcept {
  static const auto real = reinterpret_cast<void (*)(addrinfo*)>(dlsym(RTLD_NEXT, "freeaddrinfo"));
  ++released_resolver_lists;
  real(list);
}

namespace {

std::string entered(const std::string& name) { return "> " + name; }

TEST(ResolverList, HasTheAddressesOfTheNameInBothFamilies) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "2001:db8::1f", "10.1.2.4"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const Records records;
      const LiveAllocations live;
      const int released = released_resolver_lists;

      const Answer answer = call(lister);

      EXPECT_EQ(answer.rc, 0);
      EXPECT_EQ(answer.count, 3);
      EXPECT_THAT(answer.texts, UnorderedElementsAre("10.1.2.3", "2001:db8::1f", "10.1.2.4"));
      EXPECT_THAT(records.trail(), ElementsAre(entered(lister.name), left(lister.name, 0)));
      EXPECT_EQ(live.blocks(), 0);  // the caller's list was the only allocation
      EXPECT_EQ(released_resolver_lists, released + 1);
    }
  });
}

TEST(ResolverList, IsMadeOfOneArrayAndItsStrings) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const LiveAllocations live;
      char** list = nullptr;
      int count = 0;

      ASSERT_EQ(lister.list(&list, &count), 0);

      EXPECT_EQ(live.blocks(), unlessSanitized(3));
      taken(0, list, count);
    }
  });
}

TEST(ResolverList, EndsInANullEntryWithRoomForOneMore) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    for (const Lister& lister : kListers) {
      char** list = nullptr;
      int count = 0;
      ASSERT_EQ(lister.list(&list, &count), 0);
      ASSERT_EQ(count, 1);
      EXPECT_STREQ(list[0], "10.1.2.3");
      EXPECT_EQ(list[1], nullptr);
      taken(0, list, count);
    }
  });
}

TEST(ResolverList, IsThatOfTheNameAskedFor) {
  REQUIRE_NETWORK();
  withNetwork("10.1.2.3 thishost\n127.0.0.9 localhost\n10.1.2.5 other\n", [] {
    expectList(call(kListers[0]), {"10.1.2.3"});
    expectList(call(kListers[1]), {"127.0.0.9"});
  });
}

TEST(ResolverList, KeepsTheResolversOrder) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "2001:db8::1f", "127.0.0.1", "192.0.2.7", "::1"}), [] {
    startLoopback();
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      addrinfo hints = {};
      hints.ai_socktype = SOCK_STREAM;
      addrinfo* found = nullptr;
      ASSERT_EQ(getaddrinfo(lister.host, nullptr, &hints, &found), 0);
      std::vector<std::string> expected;
      for (const addrinfo* at = found; at != nullptr; at = at->ai_next) {
        const char* const socket_address = reinterpret_cast<const char*>(at->ai_addr);
        char text[INET6_ADDRSTRLEN];
        const size_t offset = at->ai_family == AF_INET ? offsetof(sockaddr_in, sin_addr)
                                                       : offsetof(sockaddr_in6, sin6_addr);
        ASSERT_NE(inet_ntop(at->ai_family, socket_address + offset, text, sizeof text), nullptr);
        expected.push_back(text);
      }
      freeaddrinfo(found);
      ASSERT_EQ(expected.size(), 5U);

      expectList(call(lister), expected);
    }
  });
}

TEST(ResolverList, KeepsDuplicates) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.3"}), [] {
    for (const Lister& lister : kListers) expectList(call(lister), {"10.1.2.3", "10.1.2.3"});
  });
}

TEST(ResolverList, OfTheLongestHostName) {
  REQUIRE_NETWORK();
  const std::string name(64, 'h');
  withNetwork("10.1.2.3 " + name + "\n", [&] {
    ASSERT_EQ(sethostname(name.data(), name.size()), 0);
    expectList(call(kListers[0]), {"10.1.2.3"});
  });
}

TEST(ResolverList, OfManyAddresses) {
  REQUIRE_NETWORK();
  std::vector<std::string> addresses;
  for (int i = 0; i < 200; ++i) addresses.push_back("10.1.2." + std::to_string(i));
  withNetwork(hostsOf(addresses), [&] {
    for (const Lister& lister : kListers) {
      Answer answer = call(lister);
      EXPECT_EQ(answer.count, 200);
      std::sort(answer.texts.begin(), answer.texts.end());
      std::vector<std::string> expected = addresses;
      std::sort(expected.begin(), expected.end());
      EXPECT_EQ(answer.texts, expected);
    }
  });
}

TEST(ResolverList, AsksGethostbynameOnceBeforeTheOtherLookUpAndIgnoresItsAnswer) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const Records records;
      passed = {};
      std::vector<std::string> order;
      const BeforeCall first(Call::gethostbyname, [&] { order.push_back("gethostbyname"); });
      const BeforeCall second(Call::getaddrinfo, [&] { order.push_back("getaddrinfo"); });
      const FailingCall ignored(Call::gethostbyname, ENOENT);

      expectList(call(lister), {"10.1.2.3"});

      EXPECT_TRUE(ignored.fired());
      EXPECT_EQ(ignored.calls(), 1);
      EXPECT_EQ(passed.host_name, lister.host);
      EXPECT_THAT(order, ElementsAre("gethostbyname", "getaddrinfo"));
      EXPECT_THAT(records.trail(), ElementsAre(entered(lister.name), left(lister.name, 0)));
    }
  });
}

TEST(ResolverList, AsksForNumbersOfUpTo46CharactersAndForNoService) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      char other[] = "other";
      passed.name_info = {1, other, 1, 0};

      expectList(call(lister), {"10.1.2.3"});

      EXPECT_EQ(passed.name_info.host_size, 47U);
      EXPECT_EQ(passed.name_info.service, nullptr);
      EXPECT_EQ(passed.name_info.service_size, 0U);
      EXPECT_EQ(passed.name_info.flags, NI_NUMERICHOST);
    }
  });
}

TEST(ResolverList, OfANameThatNobodyKnowsFailsWithTheResolversCode) {
  REQUIRE_NETWORK();
  withNetwork("10.1.2.3 other\n", [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const Records records;
      const LiveAllocations live;

      expectNoList(call(lister), EAI_NONAME);

      EXPECT_THAT(records.trail(),
                  ElementsAre(entered(lister.name), resolverText("getaddrinfo", -2),
                              left(lister.name, -2)));
      EXPECT_EQ(live.blocks(), 0);
    }
  });
}

TEST(ResolverList, OfANameThatTheNameServerDoesNotKnowFailsWithTheResolversCode) {
  REQUIRE_NETWORK();
  withNetwork("10.1.2.3 other\n", [] {
    const NameServer server(kUnknownName);
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const Records records;
      const int before = server.questions();

      expectNoList(call(lister), EAI_NONAME);

      EXPECT_GT(server.questions(), before);
      EXPECT_THAT(records.trail(),
                  ElementsAre(entered(lister.name), resolverText("getaddrinfo", -2),
                              left(lister.name, -2)));
    }
  });
}

TEST(ResolverList, OfANameWithoutAnAddressIsEmptyAndASuccess) {
  REQUIRE_NETWORK();
  withNetwork("10.1.2.3 other\n", [] {
    const NameServer server(kNoError);
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      const Records records;
      const LiveAllocations live;
      const int before = server.questions();

      expectNoList(call(lister), 0);

      EXPECT_GT(server.questions(), before);
      EXPECT_THAT(
          records.trail(),
          ElementsAre(entered(lister.name), resolverText("getaddrinfo", -5), left(lister.name, 0)));
      EXPECT_EQ(live.blocks(), 0);
    }
  });
}

TEST(ResolverList, WithoutAReachableNameServerFailsWithTheResolversCode) {
  REQUIRE_NETWORK();
  withNetwork("10.1.2.3 other\n", [] {
    writeFile("/etc/nsswitch.conf", "hosts: files dns\n");
    writeFile("/etc/resolv.conf", "nameserver 192.0.2.1\nsearch .\noptions attempts:1\n");
    for (const Lister& lister : kListers) expectNoList(call(lister), EAI_AGAIN);
  });
}

TEST(ResolverList, FailsWithEveryOtherCodeOfTheResolver) {
  for (const Lister& lister : kListers) {
    SCOPED_TRACE(lister.name);
    for (const int code : {-1, -2, -3, -4, -6, -7, -8, -9, -10, -11, -12}) {
      SCOPED_TRACE(code);
      const Records records;
      const LiveAllocations live;
      const int released = released_resolver_lists;
      const NoNameLookUp no_name_look_up;
      const FailingCall resolver(Call::getaddrinfo, code);

      expectNoList(call(lister), code);

      EXPECT_TRUE(resolver.fired());
      EXPECT_THAT(records.trail(),
                  ElementsAre(entered(lister.name), resolverText("getaddrinfo", code),
                              left(lister.name, code)));
      EXPECT_EQ(live.blocks(), 0);
      EXPECT_EQ(released_resolver_lists, released);
    }
  }
}

// sic: leaks the texts of the addresses before the failed one. The array and the resolver's list
// are freed.
TEST(ResolverList, WhenAnAddressHasNoTextFailsAndLeaksTheTextsBeforeIt) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4", "10.1.2.5"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      for (int nth = 1; nth <= 3; ++nth) {
        SCOPED_TRACE(nth);
        const Records records;
        const LiveAllocations live;
        const int released = released_resolver_lists;
        const FailingCall converter(Call::getnameinfo, EAI_OVERFLOW, nth);

        expectNoList(call(lister), EAI_OVERFLOW);

        EXPECT_EQ(converter.calls(), nth);
        EXPECT_THAT(records.trail(),
                    ElementsAre(entered(lister.name), resolverText("getaddrinfo", EAI_OVERFLOW),
                                left(lister.name, EAI_OVERFLOW)));
        EXPECT_EQ(live.blocks(), unlessSanitized(nth - 1));
        EXPECT_EQ(released_resolver_lists, released + 1);
      }
    }
  });
}

// EAI_NODATA is a success only if getaddrinfo() returns it.
TEST(ResolverList, WhenAnAddressHasNoTextFailsWithEveryCode) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    for (const Lister& lister : kListers) {
      const FailingCall converter(Call::getnameinfo, EAI_NODATA);
      expectNoList(call(lister), EAI_NODATA);
    }
  });
}

TEST(ResolverList, WithoutMemoryFailsAndKeepsNothing) {
  REQUIRE_NETWORK();
  REQUIRE_OWN_MALLOC();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    for (const Lister& lister : kListers) {
      SCOPED_TRACE(lister.name);
      for (int nth = 1;; ++nth) {
        SCOPED_TRACE(nth);
        const LiveAllocations live;
        const int released = released_resolver_lists;
        FailingCall allocation(Call::allocation, ENOMEM, nth);
        const Answer answer = call(lister);
        allocation.disarm();
        EXPECT_EQ(live.blocks(), 0);
        EXPECT_EQ(released_resolver_lists, released + 1);
        if (!allocation.fired()) {
          EXPECT_EQ(answer.rc, 0);
          EXPECT_EQ(nth, 4);  // the array and two texts have failed
          break;
        }
        expectNoList(answer, EAI_MEMORY);
      }
    }
  });
}

TEST(GetAllIPAddresses, WithoutAHostNameFailsAndAsksNobody) {
  const Records records;
  const LiveAllocations live;
  const FailingCall host_name(Call::gethostname, EPERM);
  const FailingCall by_name(Call::gethostbyname, ENOENT);
  const FailingCall resolver(Call::getaddrinfo, EAI_FAIL);

  expectNoList(call(kListers[0]), -1);

  EXPECT_TRUE(host_name.fired());
  EXPECT_EQ(by_name.calls(), 0);
  EXPECT_EQ(resolver.calls(), 0);
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(records.trail(), ElementsAre("> getAllIPAddresses", resolverText("gethostname", -1),
                                           "<! getAllIPAddresses -1"));
}

TEST(GetLocalHostIPAddress, DoesNotAskForTheHostName) {
  const NoNameLookUp no_name_look_up;
  const FailingCall host_name(Call::gethostname, EPERM);
  const FailingCall resolver(Call::getaddrinfo, EAI_FAIL);

  expectNoList(call(kListers[1]), EAI_FAIL);

  EXPECT_EQ(host_name.calls(), 0);
}

TEST(GetLocalHostIPAddress, WhoseNameCannotBeCopiedFailsWithTwoTextsOfOtherFunctions) {
  const Records records;
  const LiveAllocations live;
  const FailingCall copy(Call::vra_strlcpy, 10);
  const FailingCall resolver(Call::getaddrinfo, EAI_FAIL);

  expectNoList(call(kListers[1]), 1);

  EXPECT_TRUE(copy.fired());
  EXPECT_EQ(resolver.calls(), 0);
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> getLocalHostIPAddress",
                          "E Error - pwdGetOldestHistory: vra_strlcpy failed. rc = 10\n",
                          "D getAllIPAddresses: vra_strlcpy failed with error 1. \n",
                          "<! getLocalHostIPAddress 1"));
}

TEST(GetLocalHostIPAddress, TakesACopyOfNineCharactersForGood) {
  const NoNameLookUp no_name_look_up;
  const FailingCall copy(Call::vra_strlcpy, 9);
  const FailingCall resolver(Call::getaddrinfo, EAI_FAIL);

  expectNoList(call(kListers[1]), EAI_FAIL);

  EXPECT_TRUE(copy.fired());
  EXPECT_TRUE(resolver.fired());
}

}  // namespace
