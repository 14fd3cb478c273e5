// The commands of the family "net".
#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/seccomp.h>
#include <net/if.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <functional>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "system_call_filter.h"
#include "tool.h"
#include "world.h"

namespace {

// Runs the body with these hosts, the host name "thishost" and no network.
void withHosts(const std::string& hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateNetwork([&] {
              EXPECT_EQ(sethostname("thishost", 8), 0);
              writeFile("/etc/host.conf", "multi on\n");
              writeFile("/etc/hosts", hosts);
              body();
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(Addresses, ListsThoseOfThisHostsNameAndOfLocalhost) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 thishost\n10.1.2.4 localhost\n10.1.2.5 localhost\n", [] {
    expectAnswer(osutils({"net", "addresses"}), "ADDRESS\n10.1.2.3\n");
    expectAnswer(osutils({"net", "addresses", "--json"}), "[{\"address\":\"10.1.2.3\"}]\n");
    const Result localhost = osutils({"net", "addresses", "--localhost", "--json"});
    EXPECT_EQ(localhost.status, 0);
    const auto answer = nlohmann::json::parse(localhost.out);
    std::vector<std::string> addresses;
    for (const auto& each : answer) addresses.push_back(each["address"]);
    EXPECT_THAT(addresses, ::testing::UnorderedElementsAre("10.1.2.4", "10.1.2.5"));
    // no interface has an address
    expectAnswer(osutils({"net", "addresses", "--interfaces"}), "");
    expectAnswer(osutils({"net", "addresses", "--interfaces", "--json"}), "[]\n");
  });
}

TEST(Addresses, AnUnknownNameIsAFailure) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 another\n", [] {
    const std::string unknown = "Name or service not known\n";
    for (const Arguments& command :
         {Arguments{"net", "addresses"}, Arguments{"net", "check", "10.1.2.3"}}) {
      expectFailure(
          osutils(command),
          "osutils: " + command[0] + " " + command[1] +
              ": operations error (1): cannot list the addresses of this host's name: " + unknown);
    }
  });
}

TEST(Addresses, CheckAnswersYesAndNo) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("2001:db8::1f thishost\n", [] {
    expectAnswer(osutils({"net", "check", "2001:DB8::1F"}),
                 "ADDRESS       LOCAL\n2001:DB8::1F  true\n");
    for (const std::string address : {"10.1.2.4", "", "thishost", "2001:db8::1"}) {
      SCOPED_TRACE(address);
      expectNo(osutils({"net", "check", "--json", address}),
               R"({"address":")" + address + R"(","local":false})" + "\n");
    }
  });
}

// Gives an interface an IPv4 address. An alias such as "lo:1" is created by this.
void setAddress(const char* interface, const char* address) {
  ifreq request = {};
  strcpy(request.ifr_name, interface);
  sockaddr_in socket_address = {};
  socket_address.sin_family = AF_INET;
  ASSERT_EQ(inet_pton(AF_INET, address, &socket_address.sin_addr), 1) << address;
  memcpy(&request.ifr_addr, &socket_address, sizeof socket_address);
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  EXPECT_EQ(ioctl(descriptor, SIOCSIFADDR, &request), 0) << interface << ": " << strerror(errno);
  close(descriptor);
}

TEST(Addresses, ListsThoseOfTheInterfacesWithoutTheLoopbacks) {
  REQUIRE_ROOT("to have a network of its own");
  withHosts("10.1.2.3 thishost\n", [] {
    setAddress("lo", "127.0.0.1");
    setAddress("lo:1", "10.9.8.7");
    setAddress("lo:2", "10.9.8.6");
    expectAnswer(osutils({"net", "addresses", "--interfaces"}), "ADDRESS\n10.9.8.7\n10.9.8.6\n");
    expectAnswer(osutils({"net", "addresses", "--interfaces", "--json"}),
                 R"([{"address":"10.9.8.7"},{"address":"10.9.8.6"}])"
                 "\n");
    expectAnswer(osutils({"net", "check", "10.9.8.6"}), "ADDRESS   LOCAL\n10.9.8.6  true\n");
    expectNo(osutils({"net", "check", "127.0.0.1"}), "ADDRESS    LOCAL\n127.0.0.1  false\n");
  });
}

TEST(Addresses, InterfacesThatCannotBeListedAreAFailure) {
  REQUIRE_ROOT("to have hosts of its own");
  if (prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, nullptr) == -1 && errno != EFAULT) {
    GTEST_SKIP() << "the system cannot let system calls fail";
  }
  const auto without_sockets = [] { failSystemCall(SYS_socket, 0, AF_INET6, EAFNOSUPPORT); };
  const auto without_list = [] { failSystemCall(SYS_ioctl, 1, SIOCGIFCONF, ENOTTY); };
  struct Case {
    std::function<void()> prepare;
    std::string reason;
  };
  const Case cases[] = {{without_sockets, "Address family not supported by protocol\n"},
                        {without_list, "Inappropriate ioctl for device\n"}};
  withHosts("10.1.2.3 thishost\n", [&] {
    for (const Case& each : cases) {
      SCOPED_TRACE(each.reason);
      const std::string failed = ": operations error (1): cannot list the interfaces: ";
      expectFailure(osutils({"net", "addresses", "--interfaces"}, each.prepare),
                    "osutils: net addresses" + failed + each.reason);
      expectFailure(osutils({"net", "check", "10.1.2.4"}, each.prepare),
                    "osutils: net check" + failed + each.reason);
      // an address of the host's name: the interfaces are not listed
      expectAnswer(osutils({"net", "check", "--json", "10.1.2.3"}, each.prepare),
                   R"({"address":"10.1.2.3","local":true})"
                   "\n");
    }
  });
}

TEST(Addresses, ResolveListsTheAddressesOfAName) {
  REQUIRE_ROOT("to have hosts of its own");
  withHosts("10.1.2.3 first alias\n10.1.2.4 first\n2001:db8::1 six\n10.1.2.5 last\n", [] {
    expectAnswer(osutils({"net", "resolve", "first"}),
                 "NAME   ADDRESS\nfirst  10.1.2.3\nfirst  10.1.2.4\n");
    expectAnswer(osutils({"net", "resolve", "--json", "alias"}),
                 R"([{"name":"first","address":"10.1.2.3"}])"
                 "\n");
    // for these, the resolver leaves the host of the last line in its buffer
    const std::string failed = "osutils: net resolve: no such object (32): cannot resolve ";
    for (const std::string name : {"unknown", "", "six"}) {
      SCOPED_TRACE(name);
      expectFailure(osutils({"net", "resolve", name}), failed + '"' + name + "\"\n");
    }
  });
}

TEST(Addresses, ResolveOfAnEmptyHostsFileFindsNothing) {
  REQUIRE_ROOT("to have hosts of its own");
  // The resolver returns success and leaves its buffer as it was.
  withHosts("", [] {
    expectFailure(osutils({"net", "resolve", "unknown"}),
                  "osutils: net resolve: no such object (32): cannot resolve \"unknown\"\n");
  });
}

TEST(Addresses, ResolveSaysWhyTheResolverFailed) {
  REQUIRE_ROOT("to have a resolver of its own");
  withHosts("10.1.2.3 thishost\n", [] {
    writeFile("/etc/nsswitch.conf", "hosts: dns\n");
    writeFile("/etc/resolv.conf", "nameserver 192.0.2.1\noptions attempts:1\n");
    expectFailure(osutils({"net", "resolve", "first"}),
                  "osutils: net resolve: no such object (32): cannot resolve \"first\": "
                  "Host name lookup failure\n");
  });
}

TEST(Addresses, VerbosePrintsTheResolversMessagesAndPassesThemOn) {
  REQUIRE_ROOT("to have hosts of its own");
  const TempDir temp;
  const std::string log = temp.path("log");
  // more than its buffer holds
  withHosts("10.1.2.3 first " + std::string(1000, 'x') + "\n", [&] {
    const Result result = osutils({"--verbose", "net", "resolve", "first"}, [&] {
      setenv("PRINT_DEBUG", "all", 1);
      setenv("PRINT_DEBUG_FILE", log.c_str(), 1);
    });
    EXPECT_EQ(result.status, 3);
    const std::string message = "Error - vra_gethostbyname: gethostbyname_r failed, errno=-1\n";
    EXPECT_EQ(result.err,
              message + "osutils: net resolve: no such object (32): cannot resolve \"first\"\n");
    EXPECT_THAT(contentsOf(log), ::testing::EndsWith(" " + message));
    EXPECT_EQ(osutils({"--verbose", "net", "resolve", "first"}).err, result.err);
  });
}

}  // namespace
