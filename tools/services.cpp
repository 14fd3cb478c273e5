// The services commands.
#include <errno.h>
#include <netinet/in.h>
#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "command.h"
#include "edited_file.h"

namespace services {
namespace {

using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

constexpr size_t kNameCharacters = sizeof(ServicesEntry::name) - 1;
constexpr const char* kWhiteSpace = " \t\n\v\f\r";

constexpr int kMaxPort = 65535;  // of TCP; the editor accepts more

struct Options {
  EditedFile file{"services", EtcServices::ETC_SERVICES_FILE,
                  EtcServices::ETC_SERVICES_FILE_BACKUP};
  std::string name;
  std::string port;
  std::optional<std::string> start;
  bool force = false;
  bool unused = false;
};

std::string servicesFile() { return EtcServices::ETC_SERVICES_FILE; }

// True if the editor can read the name back from the line that it writes.
bool canBeReadBack(const std::string& name) {
  return !name.empty() && name.size() <= kNameCharacters && isAsciiLetter(name.front()) &&
         std::none_of(name.begin(), name.end(),
                      [](char c) { return c == ' ' || isAsciiControl(c); });
}

void load(EtcServices& services) {
  const std::string path = servicesFile();
  requireRegularFile(path);  // commands read the file more than once
  const int code = services.readEtcServices();
  // The path is not null, but the editor could not copy it.
  if (code == OSUTILS_PARAM_ERROR) throw std::bad_alloc();
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot read " + path);
}

// The name on the first line that the editor accepts; "" if there is none.
std::string firstName(const std::string& path) {
  const Stream stream = openToRead(path);
  char line[1024];  // the editor's size: it splits longer lines into pieces
  while (fgets(line, sizeof line, stream.get()) != nullptr) {
    const char* const name = line + strspn(line, kWhiteSpace);
    const size_t length = strcspn(name, kWhiteSpace);
    const char* const port = name + length + strspn(name + length, kWhiteSpace);
    if (isAsciiLetter(*name) && isAsciiDigit(*port)) {
      return std::string(name, std::min(length, kNameCharacters));
    }
  }
  if (ferror(stream.get()) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot read " + path + ": " + strerror(errno));
  }
  return "";
}

// The whole list. The editor only looks up names, so the first name is read from the file.
Answer entries(EtcServices& services) {
  Answer list = Answer::array();
  const std::string first = firstName(servicesFile());
  if (first.empty()) return list;
  const ServicesEntry* entry = services.getServicesEntry(first.c_str());
  if (entry == nullptr) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, servicesFile() + " changed while it was read");
  }
  for (; entry != nullptr; entry = entry->next) {
    list.push_back({{"name", entry->name}, {"port", entry->port}});
  }
  return list;
}

Answer list(Options&) {
  EtcServices services;
  load(services);
  return entries(services);
}

// The words of a line that other programs read: a name, a port and aliases. Unlike the editor, they
// skip comments and do not split long lines.
using Service = std::vector<std::string>;

std::vector<Service> servicesIn(const std::string& text) {
  std::vector<Service> services;
  std::istringstream lines(text);
  lines.exceptions(std::ios::badbit);  // of memory that is missing
  for (std::string line; std::getline(lines, line);) {
    std::istringstream words(line.substr(0, line.find('#')));
    words.exceptions(std::ios::badbit);
    Service service;
    for (std::string word; words >> word;) service.push_back(word);
    if (service.size() > 1 && isAsciiDigit(service[1].front())) services.push_back(service);
  }
  return services;
}

bool hasName(const std::vector<Service>& services, const std::string& name) {
  return std::any_of(services.begin(), services.end(),
                     [&](const Service& service) { return service.front() == name; });
}

// Like the editor, passes over names that do not begin with a letter.
bool hasPort(const std::vector<Service>& services, int port) {
  return std::any_of(services.begin(), services.end(), [&](const Service& service) {
    return isAsciiLetter(service.front().front()) && atoi(service[1].c_str()) == port;
  });
}

// The service whose line other programs find for the name, as its name or an alias; "" if there is
// none.
std::string serviceFoundFor(const std::string& name, const std::vector<Service>& services) {
  for (const Service& service : services) {
    const bool is_alias = std::find(service.begin() + 2, service.end(), name) != service.end();
    if (is_alias || service.front() == name) return service.front();
  }
  return "";
}

// Refuses what the library accepts but other programs would misread.
void requirePortableEntry(const std::string& name, int port, const std::vector<Service>& services) {
  if (port > kMaxPort) {
    throw Usage("PORT is above " + std::to_string(kMaxPort) + ": other programs would read it as " +
                std::to_string(port & kMaxPort) + " (--force adds it anyway)");
  }
  if (name.find_first_of("#/") != std::string::npos) {
    throw Usage(
        "NAME contains \"#\" or \"/\": other programs would not find it (--force adds it "
        "anyway): " +
        inQuotes(name));
  }
  const std::string found = serviceFoundFor(name, services);
  if (!found.empty()) {
    throw Failure(OSUTILS_ALREADY_EXISTS, "other programs would find the line of " +
                                              inQuotes(found) + " in " + servicesFile() + " for " +
                                              inQuotes(name) + " (--force adds it anyway)");
  }
}

Answer add(Options& options, bool dry_run) {
  const std::string path = servicesFile();
  const std::string& name = options.name;
  const int port = numberFrom<int>(options.port, "PORT", "a whole number");
  if (!canBeReadBack(name)) {
    throw Usage("NAME must begin with a letter and have at most " +
                std::to_string(kNameCharacters) +
                " characters, without white space: " + inQuotes(name));
  }
  Edit edit(options.file, dry_run);
  EtcServices services;
  load(services);
  edit.requireCompleteLastLine();
  // The editor's list may lack services of the file: a read error counts as its end.
  const std::vector<Service> known = servicesIn(edit.before());
  if (services.doesServiceExist(name.c_str()) || hasName(known, name)) {
    throw Failure(OSUTILS_ALREADY_EXISTS, path + " has a service " + inQuotes(name));
  }
  if (!services.isPortAvaliable(port) || hasPort(known, port)) {
    throw Failure(OSUTILS_UNAVAILABLE,
                  "port " + options.port + " is used in " + path + " or outside " +
                      std::to_string(EtcServices::ETC_SERVICE_MIN_PORT) + " to " +
                      std::to_string(EtcServices::ETC_SERVICE_MAX_PORT));
  }
  if (!options.force) requirePortableEntry(name, port, known);

  const std::string line = name + "\t" + std::to_string(port) + "/tcp\n";
  const auto addService = [&] { return services.addService(name.c_str(), port); };
  const auto isThere = [&] {
    EtcServices written;  // the editor does not report write errors
    load(written);
    return written.getServicePort(name.c_str()) == port;
  };
  return edit.append(name, line, addService, isThere)
      .value_or(Answer{{"name", name}, {"port", port}});
}

Answer deleteService(Options& options, bool dry_run) {
  const std::string& name = options.name;
  Edit edit(options.file, dry_run);
  EtcServices services;
  load(services);
  if (!services.doesServiceExist(name.c_str())) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT, servicesFile() + " has no service " + inQuotes(name));
  }
  return edit.remove(
      {"a service", "name", std::string_view(" \t\n\v\f\r\0", 7)}, name,
      [&] { return services.deleteService(name.c_str()); },
      [&] {
        EtcServices written;
        load(written);
        // The list has longer names truncated, perhaps to this one.
        return name.size() < kNameCharacters && written.doesServiceExist(name.c_str());
      });
}

Answer port(Options& options) {
  EtcServices services;
  load(services);
  const char* const name = options.name.c_str();
  if (!services.doesServiceExist(name)) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT,
                  servicesFile() + " has no service " + inQuotes(options.name));
  }
  return {{"name", options.name}, {"port", services.getServicePort(name)}};
}

// True if the port can be bound in the address family; nullopt if the system lacks the family.
std::optional<bool> canBind(int family, int port) {
  const int descriptor = socket(family, SOCK_STREAM | SOCK_CLOEXEC, IPPROTO_TCP);
  if (descriptor == -1) {
    if (errno == EAFNOSUPPORT) return std::nullopt;
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  std::string("cannot create a socket: ") + strerror(errno));
  }
  const int on = 1;
  // A former server's connections in TIME_WAIT do not block the port.
  (void)setsockopt(descriptor, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
  sockaddr_in6 address6 = {};
  sockaddr_in address4 = {};
  sockaddr* address = reinterpret_cast<sockaddr*>(&address4);
  socklen_t size = sizeof address4;
  if (family == AF_INET6) {
    (void)setsockopt(descriptor, IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof on);
    address6.sin6_family = AF_INET6;
    address6.sin6_port = htons(static_cast<uint16_t>(port));
    address = reinterpret_cast<sockaddr*>(&address6);
    size = sizeof address6;
  } else {
    address4.sin_family = AF_INET;
    address4.sin_port = htons(static_cast<uint16_t>(port));
  }
  const bool bound = bind(descriptor, address, size) == 0;
  const bool has_no_address = !bound && errno == EADDRNOTAVAIL;
  (void)close(descriptor);
  if (has_no_address) return std::nullopt;
  return bound;
}

bool isUnused(int port) {
  const std::optional<bool> over_4 = canBind(AF_INET, port);
  const std::optional<bool> over_6 = canBind(AF_INET6, port);
  if (!over_4 && !over_6) throw Failure(OSUTILS_UNAVAILABLE, "this system has no TCP");
  return over_4.value_or(true) && over_6.value_or(true);
}

Answer freePort(Options& options) {
  const int start = options.start ? numberFrom<int>(*options.start, "START", "a whole number")
                                  : EtcServices::INIT_PORT_INDEX;
  EtcServices services;
  load(services);
  int port = services.findAvaliablePort(start);
  while (options.unused && port != -1 && port <= kMaxPort && !isUnused(port)) {
    port = services.findAvaliablePort(port + 1);
  }
  if (port == -1 || port > kMaxPort) {
    throw Failure(OSUTILS_UNAVAILABLE, "no free port from " + std::to_string(start) + " to " +
                                           std::to_string(kMaxPort) + " in " + servicesFile());
  }
  return {{"port", port}};
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  const Tool::Argument name = {"NAME", &options->name, "The service's name", kService};
  EditCommands<Options> commands(tool, tool.family("services", "List and edit the services file"),
                                 options);

  commands.command("list", "Show all services in the order of the file, once for each protocol",
                   list);
  Command& addition =
      commands.edit("add", "Append a line for a TCP service to the file and show it", add,
                    {{"NAME", &options->name, "The service's name"},
                     {"PORT", &options->port, "Its port, 1 to 65535; with --force up to 400000"}});
  tool.flag(addition, "--force", options->force,
            "Add even what other programs would not find or would misread");
  commands.deletion("a service", deleteService, name);
  commands.restoration();
  commands.command("port", "Show the port of a service", port, {name});
  Command& search = commands.command(
      "free-port", "Show the first port up to 65535 that no line of the file uses", freePort);
  tool.flag(search, "--unused", options->unused,
            "Skip ports that you cannot bind to over TCP on IPv4 and IPv6");
  tool.optionalArgument(
      search, "START", options->start,
      "The lowest port to try, " + std::to_string(EtcServices::INIT_PORT_INDEX) + " by default");
}

}  // namespace services
