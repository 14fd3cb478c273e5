#include <arpa/inet.h>
#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <netinet/in.h>
#include <unistd.h>

#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_iputils.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

// What inet_ntoa() returns; if null, the real function runs.
static const char* text_of_interfaces = nullptr;

extern "C"
    __attribute__((visibility("default"))) char* replaced_inet_ntoa(in_addr) __asm__("inet_ntoa");
char* replaced_inet_ntoa(in_addr address) {
  static const auto real =
      reinterpret_cast<decltype(&replaced_inet_ntoa)>(dlsym(RTLD_NEXT, "inet_ntoa"));
  return text_of_interfaces != nullptr ? const_cast<char*>(text_of_interfaces) : real(address);
}

namespace {

// ---- isValidIPAddressOnSystem ----

bool isOnSystem(std::string address) { return isValidIPAddressOnSystem(address.data()); }

// The records of a call that read the resolver's list and then that of the interfaces.
std::vector<std::string> trailOfBothLists(int first_code, int second_code, int result) {
  std::vector<std::string> trail = {"> isValidIPAddressOnSystem", "> getAllIPAddresses"};
  if (first_code != 0) trail.push_back(resolverText("getaddrinfo", first_code));
  trail.push_back("< getAllIPAddresses 0");
  trail.push_back("> getAllIPAddresses_Linux");
  trail.push_back(left("getAllIPAddresses_Linux", second_code));
  trail.push_back(left("isValidIPAddressOnSystem", result));
  return trail;
}

TEST(AddressOnSystem, RefusesNullAndEmpty) {
  char empty[] = "";
  for (char* const address : {static_cast<char*>(nullptr), empty}) {
    const Records records;
    const FailingCall host_name(Call::gethostname, EPERM);
    EXPECT_FALSE(isValidIPAddressOnSystem(address));
    EXPECT_EQ(host_name.calls(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> isValidIPAddressOnSystem", kBlank, "< isValidIPAddressOnSystem 0"));
  }
}

TEST(AddressOnSystem, IsFoundInTheResolversListAndLeavesNothing) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "2001:db8::1f", "10.1.2.4"}), [] {
    for (const char* address : {"10.1.2.3", "10.1.2.4", "2001:db8::1f"}) {
      SCOPED_TRACE(address);
      const Records records;
      const LiveAllocations live;
      const int before = openDescriptors();

      EXPECT_TRUE(isOnSystem(address));

      EXPECT_THAT(records.trail(),
                  ElementsAre("> isValidIPAddressOnSystem", "> getAllIPAddresses",
                              "< getAllIPAddresses 0", "<! isValidIPAddressOnSystem 1"));
      EXPECT_EQ(live.blocks(), 0);
      EXPECT_EQ(openDescriptors(), before);
    }
  });
}

TEST(AddressOnSystem, IsFoundInTheResolversListInEitherCaseOfLetters) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"2001:db8::abcd"}), [] {
    EXPECT_TRUE(isOnSystem("2001:db8::abcd"));
    EXPECT_TRUE(isOnSystem("2001:DB8::ABCD"));
    EXPECT_TRUE(isOnSystem("2001:dB8::aBcD"));
    EXPECT_FALSE(isOnSystem("2001:DB8::ABCE"));
    EXPECT_FALSE(isOnSystem("2001:0db8::abcd"));  // the same address, but not the same text
  });
}

// sic: leaks the first list (an array and two texts) and the socket.
TEST(AddressOnSystem, IsFoundAmongTheInterfacesAndLeaksTheResolversList) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    startLoopback();
    addAliases(4);
    for (const char* address : {"10.9.0.1", "10.9.0.3", "10.9.0.4"}) {
      SCOPED_TRACE(address);
      const Records records;
      const LiveAllocations live;
      const int before = openDescriptors();

      EXPECT_TRUE(isOnSystem(address));

      EXPECT_THAT(records.trail(), ElementsAreArray(trailOfBothLists(0, 0, 1)));
      EXPECT_EQ(live.blocks(), unlessSanitized(3));
      EXPECT_EQ(openDescriptors(), before + 1);
    }
  });
}

TEST(AddressOnSystem, ThatIsInNeitherListIsNotValid) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    startLoopback();
    addAliases(1);
    const Records records;
    const LiveAllocations live;
    const int before = openDescriptors();

    EXPECT_FALSE(isOnSystem("10.1.2.5"));

    EXPECT_THAT(records.trail(), ElementsAreArray(trailOfBothLists(0, 0, 0)));
    EXPECT_EQ(live.blocks(), unlessSanitized(3));
    EXPECT_EQ(openDescriptors(), before + 1);
  });
}

TEST(AddressOnSystem, IsComparedAsAWhole) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.34"}), [] {
    startLoopback();
    addAddress("eth0", "10.9.0.12");
    EXPECT_TRUE(isOnSystem("10.1.2.34"));
    EXPECT_TRUE(isOnSystem("10.9.0.12"));
    for (const char* other : {"10.1.2.3", "10.1.2.345", "10.9.0.1", "10.9.0.123", "1", " 10.1.2.34",
                              "10.1.2.34 ", "thishost", "010.1.2.34"}) {
      EXPECT_FALSE(isOnSystem(other)) << other;
    }
  });
}

TEST(AddressOnSystem, OfTheLoopbackAloneIsNotAmongTheInterfaces) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    startLoopback();
    EXPECT_FALSE(isOnSystem("127.0.0.1"));
  });
}

TEST(AddressOnSystem, AfterTheTenthRecordIsNotAmongTheInterfaces) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    addAliases(11);
    EXPECT_TRUE(isOnSystem("10.9.0.10"));
    EXPECT_FALSE(isOnSystem("10.9.0.11"));
  });
}

TEST(AddressOnSystem, OfTheOtherFamilyIsNotAmongTheInterfaces) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    startLoopback();
    EXPECT_FALSE(isOnSystem("::1"));
  });
}

// IPv4 addresses have no letters: the replaced inet_ntoa() returns some.
TEST(AddressOnSystem, IsComparedExactlyWithThoseOfTheInterfaces) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    addAddress("eth0", "10.9.0.1");
    text_of_interfaces = "2001:db8::ab";
    EXPECT_TRUE(isOnSystem("2001:db8::ab"));
    EXPECT_FALSE(isOnSystem("2001:DB8::AB"));
    text_of_interfaces = nullptr;
    EXPECT_FALSE(isOnSystem("2001:db8::ab"));
  });
}

TEST(AddressOnSystem, WhoseHostCannotBeLookedUpIsNotValid) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    addAddress("eth0", "10.9.0.1");
    const Records records;
    const LiveAllocations live;
    const int before = openDescriptors();

    EXPECT_FALSE(isOnSystem("10.9.0.1"));  // the interfaces are not read

    EXPECT_THAT(
        records.trail(),
        ElementsAre("> isValidIPAddressOnSystem", "> getAllIPAddresses",
                    resolverText("getaddrinfo", -2), "<! getAllIPAddresses -2",
                    "D isValidIPAddressOnSystem: Cannot get the list of IPs on the machine\n",
                    "< isValidIPAddressOnSystem 0"));
    EXPECT_EQ(live.blocks(), 0);
    EXPECT_EQ(openDescriptors(), before);
  });
}

TEST(AddressOnSystem, OfAHostWithoutANameIsNotValid) {
  const Records records;
  const FailingCall host_name(Call::gethostname, EPERM);

  EXPECT_FALSE(isOnSystem("127.0.0.1"));

  EXPECT_THAT(records.trail(),
              ElementsAre("> isValidIPAddressOnSystem", "> getAllIPAddresses",
                          resolverText("gethostname", -1), "<! getAllIPAddresses -1",
                          "D isValidIPAddressOnSystem: Cannot get the list of IPs on the machine\n",
                          "< isValidIPAddressOnSystem 0"));
}

TEST(AddressOnSystem, OfAHostWhoseNameHasNoAddressIsLookedForAmongTheInterfaces) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const NameServer server(kNoError);
    addAddress("eth0", "10.9.0.1");
    const LiveAllocations live;
    {
      const Records records;
      const int before = openDescriptors();
      EXPECT_TRUE(isOnSystem("10.9.0.1"));
      EXPECT_THAT(records.trail(), ElementsAreArray(trailOfBothLists(EAI_NODATA, 0, 1)));
      EXPECT_EQ(openDescriptors(), before + 1);
    }
    EXPECT_FALSE(isOnSystem("10.9.0.2"));
    EXPECT_EQ(live.blocks(), 0);  // there was no first list
  });
}

// The resolver's list is freed.
TEST(AddressOnSystem, IsNotValidWhenTheInterfacesCannotBeRead) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    addAddress("eth0", "10.9.0.1");
    const Records records;
    const LiveAllocations live;
    const FailingCall no_socket(Call::socket, EMFILE);
    testing::internal::CaptureStderr();

    EXPECT_FALSE(isOnSystem("10.9.0.1"));

    EXPECT_EQ(testing::internal::GetCapturedStderr(), kNoSocket);
    EXPECT_TRUE(no_socket.fired());
    EXPECT_THAT(records.trail(), ElementsAreArray(trailOfBothLists(0, -1, 0)));
    EXPECT_EQ(live.blocks(), 0);
  });
}

TEST(AddressOnSystem, IsNotValidWhenThereIsNeitherList) {
  const Records records;
  const LiveAllocations live;
  const NoNameLookUp no_name_look_up;
  const FailingCall resolver(Call::getaddrinfo, EAI_NODATA);
  const FailingCall no_socket(Call::socket, EMFILE);
  testing::internal::CaptureStderr();

  EXPECT_FALSE(isOnSystem("10.9.0.1"));

  EXPECT_EQ(testing::internal::GetCapturedStderr(), kNoSocket);
  EXPECT_TRUE(resolver.fired());
  EXPECT_THAT(records.trail(), ElementsAreArray(trailOfBothLists(EAI_NODATA, -1, 0)));
  EXPECT_EQ(live.blocks(), 0);
}

// Four allocations for the resolver's list with three texts, three for the interfaces' with two.
TEST(AddressOnSystem, IsNotValidWithoutMemory) {
  REQUIRE_NETWORK();
  REQUIRE_OWN_MALLOC();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4", "10.1.2.5"}), [] {
    startLoopback();
    addAliases(1);
    for (int nth = 1;; ++nth) {
      SCOPED_TRACE(nth);
      const LiveAllocations live;
      FailingCall allocation(Call::allocation, ENOMEM, nth);
      const bool valid = isOnSystem("10.9.0.1");
      allocation.disarm();
      if (!allocation.fired()) {
        EXPECT_TRUE(valid);
        EXPECT_EQ(nth, 8);
        break;
      }
      EXPECT_FALSE(valid);
      EXPECT_EQ(live.blocks(), 0);
    }
  });
}

TEST(AddressOnSystem, InManyThreadsIsFound) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3"}), [] {
    addAddress("eth0", "10.9.0.1");
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
      threads.emplace_back([] {
        // The C library's lock for the storage of gethostbyname(), which nothing reads, is unknown
        // to the thread sanitizer.
        std::optional<NoNameLookUp> no_name_look_up;
        if (sanitizerOwnsMalloc()) no_name_look_up.emplace();
        for (int round = 0; round < 25; ++round) {
          EXPECT_TRUE(isOnSystem("10.1.2.3"));
          EXPECT_TRUE(isOnSystem("10.9.0.1"));
          EXPECT_FALSE(isOnSystem("10.9.0.2"));
        }
      });
    }
    for (std::thread& thread : threads) thread.join();
  });
}

// ---- Without tracing ----

TEST(HostAddresses, FailWithoutAMessageWhileTracingIsOff) {
  const Records records(0);
  const NoNameLookUp no_name_look_up;
  char address[] = "10.0.0.1";
  {
    const FailingCall host_name(Call::gethostname, EPERM, 1, 2);
    expectNoList(call(kListers[0]), -1);
    EXPECT_FALSE(isValidIPAddressOnSystem(address));
  }
  {
    const FailingCall copy(Call::vra_strlcpy, 10);
    expectNoList(call(kListers[1]), 1);
  }
  for (const Lister& lister : kListers) {
    const FailingCall resolver(Call::getaddrinfo, EAI_FAIL);
    expectNoList(call(lister), EAI_FAIL);
  }
  EXPECT_FALSE(isValidIPAddressOnSystem(nullptr));
  EXPECT_FALSE(isValidIPAddressInList(nullptr, nullptr, 0));

  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

}  // namespace
