// Resolver look-ups whose results belong to the caller.

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>

#include "ldap_clientosutils.h"
#include "scenario.h"
#include "world.h"

namespace scenarios {
namespace {

// These are the only hosts; port 25 is "post".
void makeHosts(const std::string& hosts) {
  writeFile(etcFile("hosts"), hosts);
  writeFile(etcFile("services"), "post 25/tcp\n");
  writeFile(etcFile("nsswitch.conf"), "hosts: files\nservices: files\n");
}

constexpr char kHosts[] = "10.0.0.1 server one two\n2001:db8::2 six\n";

// ---- vra_getnameinfo ----

char old_text[] = "";

std::string shownText(char* text) { return text == old_text ? "unchanged" : freed(text); }

std::string nameInfo(const char* address, bool with_host, bool with_service) {
  sockaddr_in binary = {};
  binary.sin_family = AF_INET;
  binary.sin_port = htons(25);
  inet_pton(AF_INET, address, &binary.sin_addr);
  char* host = old_text;
  char* service = old_text;
  const int rc = vra_getnameinfo(reinterpret_cast<const sockaddr*>(&binary), sizeof binary,
                                 with_host ? &host : nullptr, with_service ? &service : nullptr);
  return shown(rc) + " " + shownText(host) + " " + shownText(service);
}

std::string replaced(std::string text, const std::string& part, const std::string& by) {
  const size_t at = text.find(part);
  return at == std::string::npos ? text : text.replace(at, part.size(), by);
}

Scenario nameInfoScenario(const std::string& name, const char* address, bool with_host,
                          bool with_service, const std::string& result,
                          const std::string& failed_lookup,
                          const std::vector<std::string>& no_memory) {
  Scenario scenario{.name = "vra_getnameinfo, " + name,
                    .symbols = {"vra_getnameinfo"},
                    .prepare = [] { makeHosts(kHosts); },
                    .run = [=] { return nameInfo(address, with_host, with_service); },
                    .ends = {{kNothing, result}, {kLookup, failed_lookup}}};
  for (const std::string& end : no_memory) scenario.ends.push_back({kMemory, end});
  // Where the name of the host, of the service or of both is not found.
  for (const bool without_host : {false, true}) {
    std::string numbers = without_host ? replaced(result, "server", address) : result;
    scenario.ends.push_back({kLookup, numbers});
    scenario.ends.push_back({kLookup, replaced(numbers, "post", "25")});
  }
  return scenario;
}

// ---- vra_gethostbyname, vra_gethostbyaddr ----

hostent old_entry;

// The result code, the size, and then the name, the aliases and the addresses.
std::string shownHost(int rc, hostent* entry, int size, bool is_found) {
  std::string text = shown(rc) + " " + shown(size);
  if (entry == &old_entry) return text + " unchanged";
  if (entry == nullptr) return text + " null";
  if (is_found && entry->h_name == nullptr) {
    text += " unfilled";
  } else if (is_found) {
    text += std::string(" ") + entry->h_name;
    for (char** alias = entry->h_aliases; *alias != nullptr; ++alias)
      text += std::string(" ") + *alias;
    for (char** address = entry->h_addr_list; *address != nullptr; ++address) {
      char number[INET6_ADDRSTRLEN] = "";
      inet_ntop(entry->h_addrtype, *address, number, sizeof number);
      text += std::string(" ") + number;
    }
  }
  free(entry);
  return text;
}

std::vector<End> hostEnds(const std::string& result) {
  std::vector<End> ends = {{kNothing, result}, {kMemory, "90 0 null"}};
  // EIO and ENOMEM stand for any code of the resolver.
  for (const int code : {NETDB_INTERNAL, TRY_AGAIN, NO_RECOVERY, EIO, ENOMEM}) {
    ends.push_back({kLookup, shown(code) + " 0 null"});
  }
  ends.push_back({kLookup, "0 1024 unfilled"});  // the resolver succeeds but finds nothing
  return ends;
}

Scenario byName(const std::string& name, const std::string& hosts, const char* host, bool is_found,
                const std::string& result) {
  return {.name = "vra_gethostbyname, " + name,
          .symbols = {"vra_gethostbyname"},
          .prepare = [hosts] { makeHosts(hosts); },
          .run =
              [=] {
                hostent* entry = &old_entry;
                int size = 4711;
                const int rc = vra_gethostbyname(host, &entry, &size);
                return shownHost(rc, entry, size, is_found);
              },
          .ends = hostEnds(result)};
}

Scenario byAddress(const std::string& name, const std::string& hosts, int family,
                   const char* address, bool is_found, const std::string& result) {
  return {.name = "vra_gethostbyaddr, " + name,
          .symbols = {"vra_gethostbyaddr"},
          .prepare = [hosts] { makeHosts(hosts); },
          .run =
              [=] {
                in6_addr binary;
                inet_pton(family, address, &binary);
                const socklen_t length = family == AF_INET ? sizeof(in_addr) : sizeof binary;
                hostent* entry = &old_entry;
                int size = 4711;
                const int rc = vra_gethostbyaddr(&binary, length, family, &entry, &size);
                return shownHost(rc, entry, size, is_found);
              },
          .ends = hostEnds(result)};
}

// A line that does not fit into the block of the result.
std::string longLine() {
  std::string line = "10.0.0.1 server";
  for (int i = 0; i < 100; ++i) line += " a234567";
  return line + "\n";
}

// ---- calcHostentSize, copyHostent ----

// The host "h" at 10.0.0.1, copied into a block of exactly its size.
std::string copied() {
  char name[] = "h";
  char address[] = {10, 0, 0, 1, 0};
  char* aliases[] = {nullptr};
  char* addresses[] = {address, nullptr};
  hostent entry = {name, aliases, AF_INET, 4, addresses};
  const int size = calcHostentSize(&entry);
  std::vector<char> block(static_cast<size_t>(size));
  const int rc = copyHostent(&entry, reinterpret_cast<hostent*>(block.data()));
  hostent copy;
  memcpy(&copy, block.data(), sizeof copy);
  char* first_address;  // not aligned
  memcpy(&first_address, reinterpret_cast<char*>(copy.h_addr_list), sizeof first_address);
  return shown(size) + " " + shown(rc) + " " + copy.h_name + " " + shown(copy.h_addrtype) + " " +
         shown(copy.h_length) + " " + shown(static_cast<int>(strlen(first_address))) + " " +
         shown(first_address[0]);
}

}  // namespace

std::vector<Scenario> hostScenarios() {
  const std::vector<std::string> kSymbols = {"_Z15calcHostentSizeP7hostent",
                                             "_Z11copyHostentP7hostentS0_"};
  return {
      nameInfoScenario("both", "10.0.0.1", true, true, R"(0 "server" "post")", "1 null null",
                       {"90 null unchanged", "90 null null"}),
      nameInfoScenario("the host", "10.0.0.1", true, false, R"(0 "server" unchanged)",
                       "1 null unchanged", {"90 null unchanged"}),
      nameInfoScenario("the service", "10.0.0.1", false, true, R"(0 unchanged "post")",
                       "1 unchanged null", {"90 unchanged null"}),
      nameInfoScenario("an unknown host", "10.0.0.9", true, true, R"(0 "10.0.0.9" "post")",
                       "1 null null", {"90 null unchanged", "90 null null"}),
      {.name = "vra_getnameinfo, neither",
       .symbols = {"vra_getnameinfo"},
       .run = [] { return nameInfo("10.0.0.1", false, false); },
       .ends = {{kNothing, "89 unchanged unchanged"}}},
      {.name = "vra_getnameinfo, no address",
       .symbols = {"vra_getnameinfo"},
       .run =
           [] {
             const sockaddr address = {};
             char* host = old_text;
             char* service = old_text;
             const int null_rc = vra_getnameinfo(nullptr, sizeof address, &host, &service);
             const int empty_rc = vra_getnameinfo(&address, 0, &host, &service);
             return shown(null_rc) + " " + shown(empty_rc) + " " + shownText(host) + " " +
                    shownText(service);
           },
       .ends = {{kNothing, "89 89 unchanged unchanged"}}},
      {.name = "vra_getnameinfo, an address that is too short",
       .symbols = {"vra_getnameinfo"},
       .run =
           [] {
             sockaddr address = {};
             address.sa_family = AF_INET;
             char* host = old_text;
             char* service = old_text;
             const int rc = vra_getnameinfo(&address, 1, &host, &service);
             return shown(rc) + " " + shownText(host) + " " + shownText(service);
           },
       .ends = {{kNothing, "1 null null"},
                {kMemory, "90 null unchanged"},
                {kMemory, "90 null null"}}},
      byName("known", kHosts, "server", true, "0 1024 server one two 10.0.0.1"),
      byName("unknown", kHosts, "unknown", false, "0 1024"),
      byName("too long", longLine(), "server", true, "-1 0 null"),
      {.name = "vra_gethostbyname, null outputs",
       .symbols = {"vra_gethostbyname"},
       .run =
           [] {
             hostent* entry = &old_entry;
             int size = 4711;
             const int first = vra_gethostbyname("server", nullptr, &size);
             const int second = vra_gethostbyname("server", &entry, nullptr);
             return shown(first) + " " + shownHost(second, entry, size, false);
           },
       .ends = {{kNothing, "89 89 4711 unchanged"}}},
      byAddress("known", kHosts, AF_INET, "10.0.0.1", true, "0 1024 server one two 10.0.0.1"),
      byAddress("of the other family", kHosts, AF_INET6, "2001:db8::2", true,
                "0 1024 six 2001:db8::2"),
      byAddress("unknown", kHosts, AF_INET, "10.0.0.9", false, "0 1024"),
      byAddress("too long", longLine(), AF_INET, "10.0.0.1", true, "-1 0 null"),
      {.name = "vra_gethostbyaddr, null outputs",
       .symbols = {"vra_gethostbyaddr"},
       .run =
           [] {
             const in_addr address = {};
             hostent* entry = &old_entry;
             int size = 4711;
             const int first = vra_gethostbyaddr(&address, sizeof address, AF_INET, nullptr, &size);
             const int second =
                 vra_gethostbyaddr(&address, sizeof address, AF_INET, &entry, nullptr);
             return shown(first) + " " + shownHost(second, entry, size, false);
           },
       .ends = {{kNothing, "89 89 4711 unchanged"}}},
      {.name = "copyHostent",
       .symbols = kSymbols,
       .run = copied,
       .ends = {{kNothing, "60 0 h 2 4 1 10"}}},
      {.name = "copyHostent, null",
       .symbols = kSymbols,
       .run =
           [] {
             hostent entry = {};
             return shown(calcHostentSize(nullptr)) + " " + shown(copyHostent(nullptr, &entry)) +
                    " " + shown(copyHostent(&entry, nullptr));
           },
       .ends = {{kNothing, "0 1 1"}}},
  };
}

}  // namespace scenarios
