#include <arpa/inet.h>
#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

// What the library's next conversions of an interface's address give; null for the real ones.
static const char* text_of_interfaces = nullptr;

extern "C"
    __attribute__((visibility("default"))) char* replaced_inet_ntoa(in_addr) __asm__("inet_ntoa");
char* replaced_inet_ntoa(in_addr address) {
  static const auto real =
      reinterpret_cast<decltype(&replaced_inet_ntoa)>(dlsym(RTLD_NEXT, "inet_ntoa"));
  return text_of_interfaces != nullptr ? const_cast<char*>(text_of_interfaces) : real(address);
}

// The resolver's lists that were released, by anybody in this program.
std::atomic<int> released_resolver_lists = 0;

extern "C" __attribute__((visibility("default"))) void freeaddrinfo(addrinfo* list) noexcept {
  static const auto real = reinterpret_cast<void (*)(addrinfo*)>(dlsym(RTLD_NEXT, "freeaddrinfo"));
  ++released_resolver_lists;
  real(list);
}

namespace {

constexpr char kHostName[] = "thishost";
constexpr char kNoSocket[] = "Error getting size of interface :: Bad file descriptor\n";
constexpr char kBlank[] = "D isValidIPAddressOnSystem: passed an NULL or blank IP address\n";

#define REQUIRE_NETWORK() REQUIRE_ROOT("for a network, a host name and an /etc of its own")

// ---- the world ----

void require(bool done, const char* what) {
  if (!done) {
    ADD_FAILURE() << what << ": " << strerror(errno);
    throw std::runtime_error(what);
  }
}

// Runs the body in a child process that is called kHostName, knows the hosts of this file and no
// others, and has a network of its own without a single address.
void withNetwork(std::string_view hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateNetwork([&] {
              require(sethostname(kHostName, strlen(kHostName)) == 0, "sethostname");
              writeFile("/etc/host.conf", "multi on\n");
              writeFile("/etc/hosts", hosts);
              body();
              return 0;
            }),
            0);
}

// Brings 127.0.0.1 along when the interface has no address yet.
void startLoopback() {
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  ifreq request = {};
  strcpy(request.ifr_name, "lo");
  require(ioctl(descriptor, SIOCGIFFLAGS, &request) == 0, "flags of lo");
  request.ifr_flags = static_cast<short>(request.ifr_flags | IFF_UP);
  require(ioctl(descriptor, SIOCSIFFLAGS, &request) == 0, "lo up");
  close(descriptor);
}

// Gives the loopback interface one more address. The list of the interfaces has it as a record of
// its own, under the name `label`.
void addAddress(const std::string& label, const std::string& address) {
  struct {
    nlmsghdr header;
    ifaddrmsg message;
    char attributes[64];
  } request = {};
  request.header.nlmsg_type = RTM_NEWADDR;
  request.header.nlmsg_flags = NLM_F_REQUEST | NLM_F_CREATE | NLM_F_EXCL | NLM_F_ACK;
  request.message.ifa_family = AF_INET;
  request.message.ifa_prefixlen = 32;
  request.message.ifa_index = if_nametoindex("lo");

  size_t size = NLMSG_LENGTH(sizeof request.message);
  const auto add = [&](unsigned short type, const void* data, size_t length) {
    const rtattr attribute = {static_cast<unsigned short>(RTA_LENGTH(length)), type};
    char* const at = reinterpret_cast<char*>(&request) + size;
    memcpy(at, &attribute, sizeof attribute);
    memcpy(at + RTA_LENGTH(0), data, length);
    size += RTA_SPACE(length);
  };
  in_addr binary;
  require(inet_pton(AF_INET, address.c_str(), &binary) == 1, "address");
  add(IFA_LOCAL, &binary, sizeof binary);
  add(IFA_LABEL, label.c_str(), label.size() + 1);
  request.header.nlmsg_len = static_cast<unsigned>(size);

  const int descriptor = socket(AF_NETLINK, SOCK_RAW, NETLINK_ROUTE);
  require(send(descriptor, &request, size, 0) == static_cast<ssize_t>(size), "netlink send");
  struct {
    nlmsghdr header;
    nlmsgerr error;
    char rest[256];
  } answer;
  require(recv(descriptor, &answer, sizeof answer, 0) > 0, "netlink answer");
  errno = -answer.error.error;
  require(answer.header.nlmsg_type == NLMSG_ERROR && answer.error.error == 0, "new address");
  close(descriptor);
}

// Answers every question on 127.0.0.1 with this code and no records, until the end of the scope.
class NameServer {
 public:
  explicit NameServer(unsigned char code) : descriptor_(socket(AF_INET, SOCK_DGRAM, 0)) {
    startLoopback();
    writeFile("/etc/nsswitch.conf", "hosts: files dns\n");
    writeFile("/etc/resolv.conf", "nameserver 127.0.0.1\nsearch .\noptions attempts:1\n");
    address_.sin_family = AF_INET;
    address_.sin_port = htons(53);
    address_.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    require(bind(descriptor_, reinterpret_cast<const sockaddr*>(&address_), sizeof address_) == 0,
            "bind to port 53");
    thread_ = std::thread([this, code] { serve(code); });
  }
  ~NameServer() {
    // An empty message ends the service.
    sendto(descriptor_, "", 0, 0, reinterpret_cast<const sockaddr*>(&address_), sizeof address_);
    thread_.join();
    close(descriptor_);
  }
  NameServer(const NameServer&) = delete;
  NameServer& operator=(const NameServer&) = delete;

  int questions() const { return questions_; }

 private:
  void serve(unsigned char code) {
    unsigned char message[512];
    for (;;) {
      sockaddr_in client;
      socklen_t client_size = sizeof client;
      auto* const client_address = reinterpret_cast<sockaddr*>(&client);
      const ssize_t size =
          recvfrom(descriptor_, message, sizeof message, 0, client_address, &client_size);
      if (size <= 0) return;
      ++questions_;
      message[2] |= 0x80;         // an answer
      message[3] = 0x80U | code;  // recursion available
      sendto(descriptor_, message, static_cast<size_t>(size), 0, client_address, client_size);
    }
  }

  int descriptor_;
  sockaddr_in address_ = {};
  std::atomic<int> questions_ = 0;
  std::thread thread_;
};

constexpr unsigned char kNoError = 0;
constexpr unsigned char kUnknownName = 3;

// The name look-up whose answer is ignored asks nobody outside a private network.
class NoNameLookUp {
 private:
  FailingCall look_up_{Call::gethostbyname, ENOENT, 1, 1000};
};

// ---- lists ----

char* untouched_entries[] = {nullptr};
char** const kUntouched = untouched_entries;

// An answer, with the list as texts and released again.
struct Answer {
  int rc;
  int count;
  bool untouched;  // the list
  std::vector<std::string> texts;
};

Answer taken(int rc, char** list, int count) {
  Answer answer = {rc, count, list == kUntouched, {}};
  if (answer.untouched) return answer;
  if (list == nullptr) {
    ADD_FAILURE() << "a null list";
    return answer;
  }
  for (char** entry = list; *entry != nullptr; ++entry) {
    answer.texts.push_back(*entry);
    free(*entry);
  }
  EXPECT_EQ(answer.texts.size(), static_cast<size_t>(count));
  list[count + 1] = nullptr;  // there is room for one more
  free(static_cast<void*>(list));
  return answer;
}

// The two functions that differ in the name that they look up only.
struct Lister {
  const char* name;
  int (*list)(char***, int*);
  const char* host;
};
const Lister kListers[] = {{"getAllIPAddresses", getAllIPAddresses, kHostName},
                           {"getLocalHostIPAddress", getLocalHostIPAddress, "localhost"}};

Answer call(const Lister& lister) {
  char** list = kUntouched;
  int count = 4711;
  const int rc = lister.list(&list, &count);
  return taken(rc, list, count);
}

Answer callLinux() {
  char** list = kUntouched;
  int count = 4711;
  ifconf scratch;
  const int rc = getAllIPAddresses_Linux(&list, &count, &scratch);
  return taken(rc, list, count);
}

void expectList(const Answer& answer, const std::vector<std::string>& texts) {
  EXPECT_EQ(answer.rc, 0);
  EXPECT_EQ(answer.count, static_cast<int>(texts.size()));
  EXPECT_THAT(answer.texts, ElementsAreArray(texts));
}

void expectNoList(const Answer& answer, int rc) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.count, 0);
  EXPECT_TRUE(answer.untouched);
}

void expectFailureOfLinux(const Answer& answer) {
  EXPECT_EQ(answer.rc, -1);
  EXPECT_EQ(answer.count, 4711);
  EXPECT_TRUE(answer.untouched);
}

std::string resolverText(const char* function, int code) {
  return "D getAllIPAddresses: " + std::string(function) + " failed with error " +
         std::to_string(code) + ": " + gai_strerror(code) + "\n";
}

std::string entered(const std::string& name) { return "> " + name; }

std::string left(const std::string& name, int code) {
  return (code == 0 ? "< " : "<! ") + name + " " + std::to_string(code);
}

int unlessSanitized(int blocks) { return sanitizerOwnsMalloc() ? 0 : blocks; }

// The hosts file with these addresses for both names.
std::string hostsOf(const std::vector<std::string>& addresses) {
  std::string hosts;
  for (const Lister& lister : kListers) {
    for (const std::string& address : addresses) hosts += address + " " + lister.host + "\n";
  }
  return hosts;
}

// ---- getAllIPAddresses, getLocalHostIPAddress ----

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
      EXPECT_EQ(live.blocks(), 0);  // the list was the caller's, and there was no more
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

// The texts of the addresses before the failed one stay behind, as callers' accounting expects; the
// array and the resolver's list do not.
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

// "No address" is a success only when the name was looked up.
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

// ---- getAllIPAddresses_Linux ----

// 10.9.0.1 and so on, each in a record of its own ("lo:1" and so on).
std::vector<std::string> addAliases(int number) {
  std::vector<std::string> addresses;
  for (int i = 1; i <= number; ++i) {
    addresses.push_back("10.9.0." + std::to_string(i));
    addAddress("lo:" + std::to_string(i), addresses.back());
  }
  return addresses;
}

TEST(InterfaceList, WithoutInterfacesIsEmpty) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const Records records;
    const LiveAllocations live;
    expectList(callLinux(), {});
    EXPECT_EQ(live.blocks(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> getAllIPAddresses_Linux", "< getAllIPAddresses_Linux 0"));
  });
}

TEST(InterfaceList, CountsTheLoopbackWithoutItsAddress) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    expectList(callLinux(), {""});
  });
}

TEST(InterfaceList, OfALoopbackAndOneMoreInterface) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    addAddress("eth0", "192.0.2.17");
    expectList(callLinux(), {"", "192.0.2.17"});
  });
}

TEST(InterfaceList, TakesOnlyTheVeryNameForTheLoopback) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    addAddress("lo:1", "10.9.0.1");
    addAddress("l", "10.9.0.2");
    addAddress("lo", "10.9.0.3");
    addAddress("lo0", "10.9.0.4");
    addAddress("LO", "127.0.0.5");
    addAddress("lo", "127.0.0.6");
    addAddress("fifteen-letters", "255.255.255.254");
    expectList(callLinux(),
               {"10.9.0.1", "10.9.0.2", "", "10.9.0.4", "127.0.0.5", "", "255.255.255.254"});
  });
}

TEST(InterfaceList, HasAtMostTenOfTheRecords) {
  REQUIRE_NETWORK();
  for (const int records : {2, 9, 10, 11, 25, 30}) {
    SCOPED_TRACE(records);
    withNetwork("", [records] {
      startLoopback();
      std::vector<std::string> expected = addAliases(records - 1);
      expected.insert(expected.begin(), "");
      if (expected.size() > 10) expected.resize(10);
      const LiveAllocations live;

      expectList(callLinux(), expected);

      EXPECT_EQ(live.blocks(), 0);
    });
  }
}

// 25 records of 40 bytes are all that the list's 1024 bytes hold, and nobody asks for more.
TEST(InterfaceList, IsAskedForOnceInARoomForTwentyFiveRecords) {
  REQUIRE_NETWORK();
  for (const int records : {10, 24, 25, 26, 30}) {
    SCOPED_TRACE(records);
    withNetwork("", [records] {
      addAliases(records);
      char** list = kUntouched;
      int count = 4711;
      ifconf scratch = {};
      const FailingCall requests(Call::ioctl, 0, kNever);

      const int rc = getAllIPAddresses_Linux(&list, &count, &scratch);

      EXPECT_EQ(taken(rc, list, count).texts.size(), 10U);
      EXPECT_EQ(requests.calls(), 1);
      EXPECT_EQ(scratch.ifc_len, std::min(records, 25) * 40);
      EXPECT_EQ(scratch.ifc_buf, nullptr);
    });
  }
}

TEST(InterfaceList, IsMadeOfOneArrayAndItsStrings) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    addAliases(2);
    const LiveAllocations live;
    char** list = nullptr;
    int count = 0;
    ifconf scratch;

    ASSERT_EQ(getAllIPAddresses_Linux(&list, &count, &scratch), 0);

    EXPECT_EQ(live.blocks(), unlessSanitized(4));
    EXPECT_EQ(list[3], nullptr);
    taken(0, list, count);
  });
}

TEST(InterfaceList, LeavesASocketOpen) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const int before = openDescriptors();
    callLinux();
    callLinux();
    EXPECT_EQ(openDescriptors(), before + 2);
  });
}

TEST(InterfaceList, KeepsNoPointerIntoTheFunction) {
  char** list = kUntouched;
  int count = 4711;
  char old[] = "old";
  ifconf scratch = {};
  scratch.ifc_buf = old;
  const FailingCall request(Call::ioctl, EBADF);
  testing::internal::CaptureStderr();
  EXPECT_EQ(getAllIPAddresses_Linux(&list, &count, &scratch), -1);
  testing::internal::GetCapturedStderr();
  EXPECT_EQ(scratch.ifc_buf, nullptr);
}

TEST(InterfaceList, ThatCannotBeReadFailsWithATextOnStandardError) {
  EXPECT_EQ(inChild([] {  // for the socket that stays open
              const Records records;
              const LiveAllocations live;
              const int before = openDescriptors();
              const FailingCall request(Call::ioctl, EPERM);
              testing::internal::CaptureStderr();

              const Answer answer = callLinux();

              EXPECT_EQ(testing::internal::GetCapturedStderr(),
                        "Error getting size of interface :: Operation not permitted\n");
              EXPECT_TRUE(request.fired());
              EXPECT_EQ(request.calls(), 1);
              expectFailureOfLinux(answer);
              EXPECT_EQ(openDescriptors(), before + 1);
              EXPECT_EQ(live.blocks(), 0);
              EXPECT_THAT(records.trail(), ElementsAre("> getAllIPAddresses_Linux",
                                                       "<! getAllIPAddresses_Linux -1"));
              return 0;
            }),
            0);
}

TEST(InterfaceList, WithoutASocketCannotBeReadEither) {
  const int before = openDescriptors();
  const FailingCall no_socket(Call::socket, EAFNOSUPPORT);
  testing::internal::CaptureStderr();

  const Answer answer = callLinux();

  EXPECT_EQ(testing::internal::GetCapturedStderr(), kNoSocket);  // tracing is off: always written
  EXPECT_TRUE(no_socket.fired());
  expectFailureOfLinux(answer);
  EXPECT_EQ(openDescriptors(), before);
}

TEST(InterfaceList, WithoutMemoryFailsAndKeepsNothingButTheSocket) {
  REQUIRE_NETWORK();
  REQUIRE_OWN_MALLOC();
  withNetwork("", [] {
    startLoopback();
    addAliases(1);
    for (int nth = 1;; ++nth) {
      SCOPED_TRACE(nth);
      const Records records;
      const LiveAllocations live;
      const int before = openDescriptors();
      FailingCall allocation(Call::allocation, ENOMEM, nth);
      testing::internal::CaptureStderr();
      const Answer answer = callLinux();
      EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
      allocation.disarm();
      EXPECT_EQ(live.blocks(), 0);
      EXPECT_EQ(openDescriptors(), before + 1);
      if (!allocation.fired()) {
        EXPECT_EQ(answer.rc, 0);
        EXPECT_EQ(nth, 4);  // the array and two texts have failed
        break;
      }
      expectFailureOfLinux(answer);
      EXPECT_THAT(records.trail(),
                  ElementsAre("> getAllIPAddresses_Linux", "<! getAllIPAddresses_Linux -1"));
    }
  });
}

// ---- getAllIPAddresses_TVX ----

TEST(GetAllIPAddressesTVX, AnswersZeroThroughTheGlobalScopeAndLeavesNoRecord) {
  const Records records;
  const LiveAllocations live;
  const int before = openDescriptors();
  ldtr_fun.SetErrorCode(4711);

  EXPECT_EQ(getAllIPAddresses_TVX(), 0);

  long code;
  memcpy(&code, static_cast<const void*>(&ldtr_fun), sizeof code);
  EXPECT_EQ(code, 0);
  EXPECT_THAT(records.trail(), IsEmpty());
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(openDescriptors(), before);
}

// ---- isValidIPAddressOnSystem ----

bool isOnSystem(std::string address) { return isValidIPAddressOnSystem(address.data()); }

// The records of a call that found the resolver's list good and had to go on to the interfaces'.
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

// The first list, an array and two texts, stays allocated, and the socket stays open.
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

TEST(AddressOnSystem, BehindTheTenthRecordIsNotAmongTheInterfaces) {
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

// No address of an interface has letters: these come from a replaced conversion.
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

    EXPECT_FALSE(isOnSystem("10.9.0.1"));  // the interfaces are not asked

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

// The resolver's list is still the one held, and is released.
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

// Four allocations for the resolver's list of three, three for that of the interfaces' two.
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
        // The C library's lock round the storage of gethostbyname(), which nobody reads, is unknown
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

// ---- without tracing ----

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

// ---- isValidIPAddressInList ----

// A list as a caller has it; an entry "(null)" is a null one.
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
