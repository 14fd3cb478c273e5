// The services commands: look at and edit the lines of the services file.
#include <osutils.h>
#include <stdio.h>
#include <string.h>

#include <algorithm>
#include <memory>

#include "command.h"
#include "edited_file.h"

namespace services {
namespace {

using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

constexpr size_t kNameCharacters = sizeof(ServicesEntry::name) - 1;
constexpr const char* kWhiteSpace = " \t\n\v\f\r";

struct Options {
  EditedFile file;
  std::string name;
  std::string port;
  std::optional<std::string> start;
};

std::string servicesFile() { return EtcServices::ETC_SERVICES_FILE; }

// True for a name that the editor finds again in the line that it writes for it.
bool canBeReadBack(const std::string& name) {
  return !name.empty() && name.size() <= kNameCharacters && isAsciiLetter(name.front()) &&
         std::none_of(name.begin(), name.end(),
                      [](char c) { return c == ' ' || isAsciiControl(c); });
}

void load(EtcServices& services) {
  const std::string path = servicesFile();
  requireRegularFile(path);  // commands read the file more than once
  const int code = services.readEtcServices();
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot read " + path);
}

// The name on the first line of which the editor makes a record, or "" when there is no such line.
std::string firstName(const std::string& path) {
  const Stream stream = openToRead(path);
  char line[1024];  // the editor's own length: it takes the pieces of a longer line for lines
  while (fgets(line, sizeof line, stream.get()) != nullptr) {
    const char* const name = line + strspn(line, kWhiteSpace);
    const size_t length = strcspn(name, kWhiteSpace);
    const char* const port = name + length + strspn(name + length, kWhiteSpace);
    if (isAsciiLetter(*name) && isAsciiDigit(*port)) {
      return std::string(name, std::min(length, kNameCharacters));
    }
  }
  return "";
}

// The whole list. The editor can only be asked for a name, so the file tells with which one it begins.
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

Answer add(Options& options) {
  const std::string path = servicesFile();
  const std::string& name = options.name;
  const int port = numberFrom<int>(options.port, "PORT", "a whole number");
  if (!canBeReadBack(name)) {
    throw Usage("NAME must begin with a letter and have at most " +
                std::to_string(kNameCharacters) +
                " characters, without white space: " + inQuotes(name));
  }
  EtcServices services;
  load(services);
  if (!isLastLineComplete(path)) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM,
                  "the last line of " + path + " has no newline, the new one would join it");
  }
  const int code = services.addService(name.c_str(), port);
  if (code == OSUTILS_ALREADY_EXISTS) {
    throw Failure(code, path + " has a service " + inQuotes(name));
  }
  if (code == OSUTILS_UNAVAILABLE) {
    throw Failure(code, "port " + options.port + " is taken in " + path + " or not in " +
                            std::to_string(EtcServices::ETC_SERVICE_MIN_PORT) + " to " +
                            std::to_string(EtcServices::ETC_SERVICE_MAX_PORT));
  }
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot add " + inQuotes(name) + " to " + path);

  EtcServices written;  // the editor does not report write errors
  load(written);
  if (!written.doesServiceExist(name.c_str()) || written.getServicePort(name.c_str()) != port ||
      !isLastLineComplete(path)) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  "the new line of " + inQuotes(name) + " is not complete in " + path);
  }
  return {{"name", name}, {"port", port}};
}

Answer deleteService(Options& options) {
  const std::string path = servicesFile();
  const std::string& name = options.name;
  EtcServices services;
  load(services);
  const int code = services.deleteService(name.c_str());
  if (code == OSUTILS_NO_SUCH_OBJECT) {
    throw Failure(code, path + " has no service " + inQuotes(name));
  }
  if (code != OSUTILS_SUCCESS) {
    throw Failure(code, "cannot delete " + inQuotes(name) + " from " + path +
                            copyLeftAt(EtcServices::ETC_SERVICES_FILE_BACKUP, path));
  }
  EtcServices written;
  load(written);
  if (written.doesServiceExist(name.c_str())) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, path + " still has a service " + inQuotes(name));
  }
  return {{"deleted", name}};
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

Answer freePort(Options& options) {
  const int start = options.start ? numberFrom<int>(*options.start, "START", "a whole number")
                                  : EtcServices::INIT_PORT_INDEX;
  EtcServices services;
  load(services);
  const int port = services.findAvaliablePort(start);
  if (port == -1) {
    throw Failure(OSUTILS_UNAVAILABLE,
                  "no free port at or above " + std::to_string(start) + " in " + servicesFile());
  }
  return {{"port", port}};
}

}  // namespace

void addCommands(Tool& tool) {
  Command& family = tool.family("services", "Look at and edit the services file");

  const auto options = std::make_shared<Options>();
  const auto addToFamily = [&](const char* name, const char* description,
                               Answer (*action)(Options&)) -> Command& {
    Command& command = tool.command(family, name, description, [options, action] {
      options->file.select(EtcServices::ETC_SERVICES_FILE, EtcServices::ETC_SERVICES_FILE_BACKUP);
      return action(*options);
    });
    options->file.addOptions(tool, command, "/etc/services");
    return command;
  };
  const auto takeName = [&](Command& command) {
    tool.text(command, "NAME", options->name, "The service's name");
  };

  addToFamily("list", "Show all services in the order of the file, once for each protocol", list);
  Command& addition =
      addToFamily("add", "Append a line for a TCP service to the file and show it", add);
  takeName(addition);
  tool.text(addition, "PORT", options->port, "Its port, 1 to 400000");
  takeName(addToFamily("delete",
                       "Remove all lines of a service. The file is rewritten in place: keep other\n"
                       "programs from editing it meanwhile. A copy at the backup path, which is\n"
                       "overwritten, exists only until the command ends",
                       deleteService));
  takeName(addToFamily("port", "Show the port of a service", port));
  tool.optionalText(
      addToFamily("free-port", "Show the first port that no line of the file uses", freePort),
      "START", options->start,
      "The lowest port to try, " + std::to_string(EtcServices::INIT_PORT_INDEX) + " by default");
}

}  // namespace services
