// Interfaces and a name server, for a network of one's own.
#pragma once

#include <arpa/inet.h>
#include <errno.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <stdexcept>
#include <string>
#include <thread>

#include "world.h"

inline void require(bool done, const char* what) {
  if (!done) throw std::runtime_error(std::string(what) + ": " + strerror(errno));
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

// Codes of a name server.
constexpr unsigned char kNoError = 0;
constexpr unsigned char kUnknownName = 3;

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
