// Fixture of the tests of addresses.
#pragma once

#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "world.h"

constexpr char kHostName[] = "thishost";
constexpr char kNoSocket[] = "Error getting size of interface :: Bad file descriptor\n";
constexpr char kBlank[] = "D isValidIPAddressOnSystem: passed an NULL or blank IP address\n";

#define REQUIRE_NETWORK() REQUIRE_ROOT("for a network, a host name and an /etc of its own")

// ---- Network ----

inline void require(bool done, const char* what) {
  if (!done) {
    ADD_FAILURE() << what << ": " << strerror(errno);
    throw std::runtime_error(what);
  }
}

// Runs the body in a child process with the host name kHostName, with this file as /etc/hosts, and
// with a private network that has no address.
inline void withNetwork(std::string_view hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateNetwork([&] {
              require(sethostname(kHostName, strlen(kHostName)) == 0, "sethostname");
              writeFile("/etc/host.conf", "multi on\n");
              writeFile("/etc/hosts", hosts);
              body();
              return 0;
            }),
            0);
}

// Sets the loopback interface up. The kernel then adds 127.0.0.1 if the interface has no address.
inline void startLoopback() {
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  ifreq request = {};
  strcpy(request.ifr_name, "lo");
  require(ioctl(descriptor, SIOCGIFFLAGS, &request) == 0, "flags of lo");
  request.ifr_flags = static_cast<short>(request.ifr_flags | IFF_UP);
  require(ioctl(descriptor, SIOCSIFFLAGS, &request) == 0, "lo up");
  close(descriptor);
}

// Adds an address to the loopback interface. It is a separate record named `label` in the list of
// interfaces.
inline void addAddress(const std::string& label, const std::string& address) {
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

// A name server on 127.0.0.1 that answers every query with this code and no records, until the end
// of the scope.
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
    // An empty message stops the server.
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

// Makes gethostbyname() fail, whose result the library ignores, so that it sends no query to a real
// name server.
class NoNameLookUp {
 private:
  FailingCall look_up_{Call::gethostbyname, ENOENT, 1, 1000};
};

// ---- Lists ----

inline char* untouched_entries[] = {nullptr};
inline char** const kUntouched = untouched_entries;

// The outputs of one call. The list is copied to `texts` and freed.
struct Answer {
  int rc;
  int count;
  bool untouched;  // whether the list is unchanged
  std::vector<std::string> texts;
};

inline Answer taken(int rc, char** list, int count) {
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

// The two functions that differ only in the name that they look up.
struct Lister {
  const char* name;
  int (*list)(char***, int*);
  const char* host;
};
inline const Lister kListers[] = {{"getAllIPAddresses", getAllIPAddresses, kHostName},
                                  {"getLocalHostIPAddress", getLocalHostIPAddress, "localhost"}};

inline Answer call(const Lister& lister) {
  char** list = kUntouched;
  int count = 4711;
  const int rc = lister.list(&list, &count);
  return taken(rc, list, count);
}

inline void expectList(const Answer& answer, const std::vector<std::string>& texts) {
  EXPECT_EQ(answer.rc, 0);
  EXPECT_EQ(answer.count, static_cast<int>(texts.size()));
  EXPECT_THAT(answer.texts, testing::ElementsAreArray(texts));
}

inline void expectNoList(const Answer& answer, int rc) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.count, 0);
  EXPECT_TRUE(answer.untouched);
}

inline std::string resolverText(const char* function, int code) {
  return "D getAllIPAddresses: " + std::string(function) + " failed with error " +
         std::to_string(code) + ": " + gai_strerror(code) + "\n";
}

inline std::string left(const std::string& name, int code) {
  return (code == 0 ? "< " : "<! ") + name + " " + std::to_string(code);
}

inline int unlessSanitized(int blocks) { return sanitizerOwnsMalloc() ? 0 : blocks; }

// A hosts file with these addresses for both names.
inline std::string hostsOf(const std::vector<std::string>& addresses) {
  std::string hosts;
  for (const Lister& lister : kListers) {
    for (const std::string& address : addresses) hosts += address + " " + lister.host + "\n";
  }
  return hosts;
}

// Adds 10.9.0.1 and so on, each as a separate record ("lo:1" and so on).
inline std::vector<std::string> addAliases(int number) {
  std::vector<std::string> addresses;
  for (int i = 1; i <= number; ++i) {
    addresses.push_back("10.9.0." + std::to_string(i));
    addAddress("lo:" + std::to_string(i), addresses.back());
  }
  return addresses;
}
