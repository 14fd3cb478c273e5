// The net commands: addresses of this host, and resolving names.
#include <arpa/inet.h>
#include <ldap_clientosutils.h>
#include <net/if.h>
#include <netdb.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>

#include "command.h"

namespace network {
namespace {

struct Options {
  bool localhost = false;
  bool interfaces = false;
  std::string address;
  std::string name;
};

void requireResolved(int code, const std::string& name) {
  if (code == 0) return;
  throw Failure(OSUTILS_OPERATIONS_ERROR,
                "cannot list the addresses of " + name + ": " + gai_strerror(code));
}

// Makes the same system calls as the library, which reports their failure only on standard error or
// not at all.
void requireInterfaces() {
  const int descriptor = socket(AF_INET6, SOCK_DGRAM, 0);
  ifconf size_only = {};
  const bool listed = descriptor != -1 && ioctl(descriptor, SIOCGIFCONF, &size_only) == 0;
  const int error = errno;
  if (descriptor != -1) close(descriptor);
  if (!listed) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  std::string("cannot list the interfaces: ") + strerror(error));
  }
}

Answer addresses(Options& options) {
  std::vector<std::string> list;
  if (options.interfaces) {
    requireInterfaces();
    ifconf scratch = {};
    if (osutils::getAllIPAddresses_Linux(list, &scratch) != 0) {
      throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot list the interfaces");
    }
  } else if (options.localhost) {
    requireResolved(osutils::getLocalHostIPAddress(list), "localhost");
  } else {
    requireResolved(osutils::getAllIPAddresses(list), "this host's name");
  }
  Answer answer = Answer::array();
  for (const std::string& address : list) {
    if (!address.empty()) answer.push_back({{"address", address}});  // the loopback has no text
  }
  return answer;
}

Answer check(Options& options) {
  // The library also returns "no" if it cannot get the addresses of the host name, or the
  // interfaces, which it searches next. Check both first.
  std::vector<std::string> list;
  requireResolved(osutils::getAllIPAddresses(list), "this host's name");
  if (osutils::isValidIPAddressInList(options.address, list)) {
    return {{"address", options.address}, {"local", true}};
  }
  requireInterfaces();
  return {{"address", options.address},
          {"local", isValidIPAddressOnSystem(options.address.data())}};
}

// True if the entry belongs to the name: a look-up that finds nothing may return another host's
// entry.
bool isAnswerFor(const hostent& host, const std::string& name) {
  if (host.h_name == nullptr || host.h_addrtype != AF_INET || host.h_addr_list == nullptr) {
    return false;
  }
  addrinfo hints = {};
  hints.ai_family = AF_INET;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  if (getaddrinfo(name.c_str(), nullptr, &hints, &found) != 0) return false;
  const std::unique_ptr<addrinfo, void (*)(addrinfo*)> addresses(found, freeaddrinfo);
  for (const addrinfo* each = found; each != nullptr; each = each->ai_next) {
    sockaddr_in socket_address;
    memcpy(&socket_address, each->ai_addr, sizeof socket_address);
    for (char** address = host.h_addr_list; *address != nullptr; ++address) {
      if (memcmp(*address, &socket_address.sin_addr, sizeof socket_address.sin_addr) == 0)
        return true;
    }
  }
  return false;
}

Answer resolve(Options& options) {
  hostent* found = nullptr;
  int size = 0;
  const int code = vra_gethostbyname(options.name.c_str(), &found, &size);
  const osutils::Owned<hostent> host(found);
  if (code == OSUTILS_NO_MEMORY) throw std::bad_alloc();
  if (code != OSUTILS_SUCCESS || !isAnswerFor(*host, options.name)) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT,
                  "cannot resolve " + inQuotes(options.name) +
                      (code > 0 ? std::string(": ") + hstrerror(code) : ""));
  }
  Answer answer = Answer::array();
  for (char** address = host->h_addr_list; *address != nullptr; ++address) {
    char text[INET6_ADDRSTRLEN];
    if (inet_ntop(host->h_addrtype, *address, text, sizeof text) == nullptr) {
      throw Failure(OSUTILS_OTHER, inQuotes(options.name) + " has an address of an unknown family");
    }
    answer.push_back({{"name", host->h_name}, {"address", text}});
  }
  return answer;
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  Command& family = tool.family("net", "List and check the addresses of this host, resolve names");

  Command& listing = tool.command(family, "addresses", "List the addresses of this host's name",
                                  bound(options, addresses));
  Option& localhost =
      tool.flag(listing, "--localhost", options->localhost, "List those of \"localhost\" instead");
  tool.flag(listing, "--interfaces", options->interfaces,
            "List the IPv4 addresses of the first 10 interfaces, without \"lo\"")
      .excludes(&localhost);
  tool.question(family, "check", "Ask whether an address is one of this host's",
                bound(options, check), {{"ADDRESS", &options->address, "In numeric form"}});
  tool.command(family, "resolve", "List the IPv4 addresses of a name", bound(options, resolve),
               {{"NAME", &options->name, "The host's name"}});
}

}  // namespace network
