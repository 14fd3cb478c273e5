// The addresses of the host.

#include <arpa/inet.h>
#include <net/if.h>
#include <netdb.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <stdexcept>

#include "osutils.h"
#include "private_network.h"
#include "scenario.h"
#include "world.h"

namespace scenarios {
namespace {

void setAlias(const char* name, const char* address) {
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  sockaddr_in binary = {};
  binary.sin_family = AF_INET;
  binary.sin_addr.s_addr = inet_addr(address);
  ifreq request = {};
  strcpy(request.ifr_name, name);
  memcpy(&request.ifr_addr, &binary, sizeof binary);
  require(ioctl(descriptor, SIOCSIFADDR, &request) == 0, name);
  close(descriptor);
}

std::string ownName() {
  char name[65] = "";
  require(gethostname(name, sizeof name) == 0, "host name");
  return name;
}

// A host of this name whose addresses are in the hosts file and whose interfaces are the loopback
// and its alias 10.9.0.1.
void makeNetwork(const std::string& host) {
  std::string hosts = "127.0.0.1 localhost\n";
  for (const char* address : {"10.1.2.3", "10.1.2.4", "10.1.2.5"}) {
    hosts += std::string(address) + " " + host + "\n";
  }
  writeFile(etcFile("hosts"), hosts);
  writeFile(etcFile("host.conf"), "multi on\n");
  writeFile(etcFile("nsswitch.conf"), "hosts: files\n");

  struct if_nameindex* const interfaces = if_nameindex();
  require(interfaces != nullptr, "interfaces");
  const bool is_private = interfaces[0].if_index != 0 && interfaces[1].if_index == 0;
  if_freenameindex(interfaces);
  require(is_private, "the network is not a private one");
  startLoopback();
  setAlias("lo:1", "10.9.0.1");
}

// ---- Lists ----

char* no_entries[] = {nullptr};

std::string shownList(int rc, char** list, int count) {
  return shown(rc) + " " + shown(count) + " " + (list == no_entries ? "unchanged" : freed(list));
}

std::string listOf(int (*function)(char***, int*)) {
  char** list = no_entries;
  int count = 4711;
  const int rc = function(&list, &count);
  return shownList(rc, list, count);
}

Scenario addresses(const std::string& name, int (*function)(char***, int*),
                   const std::string& symbol, const std::string& host, Kinds before,
                   const std::string& before_end, const std::string& result, int texts) {
  Scenario scenario{.name = symbol + ", " + name,
                    .symbols = {symbol},
                    .prepare = [host] { makeNetwork(host.empty() ? ownName() : host); },
                    .run = [function] { return listOf(function); },
                    .ends = {{kNothing, result}, {before, before_end}}};
  for (const int code : {EAI_NONAME, EAI_AGAIN, EAI_FAIL, EAI_MEMORY, EAI_SYSTEM}) {
    const std::string end = shown(code) + " 0 unchanged";
    scenario.ends.push_back({kLookup, end});
    // The texts before the one that cannot be made.
    for (int i = 1; i < texts; ++i) scenario.ends.push_back({kLookup, end, "", {i, 0}});
  }
  if (texts > 0) scenario.ends.push_back({kMemory, shown(EAI_MEMORY) + " 0 unchanged"});
  return scenario;
}

Scenario hostAddresses(const std::string& name, const std::string& host, const std::string& result,
                       int texts) {
  Scenario scenario = addresses(name, getAllIPAddresses, "getAllIPAddresses", host, kNetwork,
                                "-1 0 unchanged", result, texts);
  // The C library puts an address last whose route it cannot look up.
  for (const char* const order :
       {R"("10.1.2.4" "10.1.2.5" "10.1.2.3")", R"("10.1.2.3" "10.1.2.5" "10.1.2.4")"}) {
    if (texts == 3) scenario.ends.push_back({kLookup, "0 3 (" + std::string(order) + ")"});
  }
  // It takes only the first if it cannot read host.conf.
  if (texts == 3) scenario.ends.push_back({kOpen | kRead, R"(0 1 ("10.1.2.3"))"});
  return scenario;
}

// ---- isValidIPAddressOnSystem ----

struct Among {
  bool host;        // the addresses of the host's name
  bool interfaces;  // those of the interfaces
};

Scenario onSystem(const std::string& name, const char* address, Among among) {
  // The list of the name's addresses has four blocks.
  const Left left = among.host ? Left{} : Left{4, 1};
  const bool result = among.host || among.interfaces;
  Scenario scenario{.name = "isValidIPAddressOnSystem, " + name,
                    .symbols = {"isValidIPAddressOnSystem"},
                    .prepare = [] { makeNetwork(ownName()); },
                    .run =
                        [address] {
                          std::string copy = address;
                          return shown(isValidIPAddressOnSystem(copy.data()));
                        },
                    .ends = {{kNothing, shown(result), "", left},
                             {kNetwork | kLookup | kMemory, "false"},
                             {kLookup, "false", "", {1, 0}},
                             {kLookup, "false", "", {2, 0}}}};
  // After a failure to list the interfaces, the first list is the one that is freed.
  if (!among.host) scenario.ends.push_back({kNetwork | kMemory, "false", "", {0, 1}});
  return scenario;
}

// ---- isValidIPAddressInList ----

Scenario inList(const std::string& name, const char* address, std::vector<const char*> list,
                int count, bool result) {
  return {.name = "isValidIPAddressInList, " + name,
          .symbols = {"isValidIPAddressInList"},
          .run =
              [=] {
                std::string copy = address;
                std::vector<char*> entries;
                for (const char* entry : list) entries.push_back(const_cast<char*>(entry));
                return shown(isValidIPAddressInList(copy.data(), entries.data(), count));
              },
          .ends = {{kNothing, shown(result)}}};
}

}  // namespace

std::vector<Scenario> networkScenarios() {
  return {
      hostAddresses("three addresses", "", R"(0 3 ("10.1.2.3" "10.1.2.4" "10.1.2.5"))", 3),
      hostAddresses("an unknown name", "other", "-2 0 unchanged", 0),
      // The name server knows the name, but no address.
      {.name = "getAllIPAddresses, a name without addresses",
       .symbols = {"getAllIPAddresses"},
       .prepare = [] { makeNetwork("other"); },
       .run =
           [] {
             const NameServer server(kNoError);
             return listOf(getAllIPAddresses);
           },
       .ends = {{kNothing, "0 0 unchanged"},
                {kNetwork, "-1 0 unchanged"},
                {kLookup, "-2 0 unchanged"},
                {kLookup, "-3 0 unchanged"},
                {kLookup, "-10 0 unchanged"},
                {kLookup, "-11 0 unchanged"}}},
      addresses("one address", getLocalHostIPAddress, "getLocalHostIPAddress", "", kPrint,
                "1 0 unchanged", R"(0 1 ("127.0.0.1"))", 1),
      {.name = "getAllIPAddresses_Linux",
       .symbols = {"getAllIPAddresses_Linux"},
       .prepare = [] { makeNetwork("other"); },
       .run =
           [] {
             char** list = no_entries;
             int count = 4711;
             ifconf scratch;
             const int rc = getAllIPAddresses_Linux(&list, &count, &scratch);
             return shownList(rc, list, count);
           },
       .ends = {{kNothing, R"(0 2 ("" "10.9.0.1"))", "", {0, 1}},
                {kNetwork, "-1 4711 unchanged"},
                {kNetwork | kMemory, "-1 4711 unchanged", "", {0, 1}}}},
      {.name = "getAllIPAddresses_TVX",
       .symbols = {"getAllIPAddresses_TVX"},
       .run = [] { return shown(getAllIPAddresses_TVX()); },
       .ends = {{kNothing, "0"}}},
      onSystem("of the host's name", "10.1.2.4", {.host = true, .interfaces = false}),
      onSystem("of an interface", "10.9.0.1", {.host = false, .interfaces = true}),
      onSystem("of neither", "10.9.0.12", {.host = false, .interfaces = false}),
      {.name = "isValidIPAddressOnSystem, of an interface, and the host's name has no address",
       .symbols = {"isValidIPAddressOnSystem"},
       .prepare = [] { makeNetwork("other"); },
       .run =
           [] {
             const NameServer server(kNoError);
             char address[] = "10.9.0.1";
             return shown(isValidIPAddressOnSystem(address));
           },
       .ends = {{kNothing, "true", "", {0, 1}},
                {kNetwork | kLookup, "false"},
                {kNetwork | kMemory, "false", "", {0, 1}}}},
      {.name = "isValidIPAddressOnSystem, null and empty",
       .symbols = {"isValidIPAddressOnSystem"},
       .run =
           [] {
             char empty[] = "";
             return shown(isValidIPAddressOnSystem(nullptr)) + " " +
                    shown(isValidIPAddressOnSystem(empty));
           },
       .ends = {{kNothing, "false false"}}},
      inList("the second", "2001:DB8::1F", {"10.0.0.12", nullptr, "2001:db8::1f"}, 3, true),
      inList("a beginning", "10.0.0.1", {"10.0.0.12"}, 1, false),
      inList("empty", "", {""}, 1, false),
      inList("no entries", "10.0.0.1", {"10.0.0.1"}, 0, false),
      {.name = "isValidIPAddressInList, null",
       .symbols = {"isValidIPAddressInList"},
       .run =
           [] {
             char address[] = "10.0.0.1";
             char* list[] = {address};
             return shown(isValidIPAddressInList(nullptr, list, 1)) + " " +
                    shown(isValidIPAddressInList(address, nullptr, 1));
           },
       .ends = {{kNothing, "false false"}}},
  };
}

}  // namespace scenarios
