// EtcServices on a private file, compared with a model after every step.
//
// An input is the file's contents and then steps, each after a record separator: one letter, and fields after field
// separators.
#include <limits.h>
#include <stddef.h>

#include <algorithm>
#include <string>
#include <vector>

#include "fuzz.h"
#include "osutils.h"
#include "platform.h"
#include "services_model.h"

using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

namespace {

struct Files {
  Files() {
    EtcServices::ETC_SERVICES_FILE = file.c_str();
    EtcServices::ETC_SERVICES_FILE_BACKUP = backup.c_str();
  }

  const Folder folder;
  const std::string file = folder.path("services");
  const std::string backup = folder.path("services.save");
};

std::string shownList(const std::vector<Service>& list) {
  std::string text;
  for (const Service& service : list) {
    text += shown(service.name) + " " + std::to_string(service.port) + "  ";
  }
  return text;
}

std::vector<Service> listOf(const EtcServices& services) {
  // After the virtual table and the path.
  const ServicesEntry* entry;
  memcpy(&entry, reinterpret_cast<const char*>(&services) + 16, sizeof entry);
  std::vector<Service> list;
  for (; entry != nullptr; entry = entry->next) list.push_back({entry->name, entry->port});
  return list;
}

int portOf(const std::string& text) {
  return static_cast<int>(std::clamp<long>(strtol(text.c_str(), nullptr, 10), INT_MIN, INT_MAX));
}

void compareQueries(EtcServices& services, const ServicesModel& model, const std::string& name) {
  expectSame("doesServiceExist", services.doesServiceExist(name.c_str()), model.has(name));
  expectSame("getServicePort", services.getServicePort(name.c_str()), model.portOf(name));
  const ServicesEntry* const entry = services.getServicesEntry(name.c_str());
  expectSame("getServicesEntry", entry != nullptr, model.has(name));
  if (entry != nullptr) expectSame("name of getServicesEntry", entry->name, name);
}

void comparePorts(EtcServices& services, const ServicesModel& model, int port) {
  expectSame("isPortAvaliable", services.isPortAvaliable(port), model.isPortFree(port));
  expectSame("findAvaliablePort", services.findAvaliablePort(port), model.freePort(port));
}

void takeStep(EtcServices& services, ServicesModel& model, const std::string& file,
              const std::string& step) {
  std::vector<std::string> fields = partsOf(upToNul(step), kFieldSeparator);
  fields.resize(3);
  const std::string& name = fields[1];
  switch (fields[0].empty() ? '\0' : fields[0][0]) {
    case 'r':
      expectSame("readEtcServices", services.readEtcServices(), model.read());
      break;
    case 'a':
      expectSame("addService", services.addService(name.c_str(), portOf(fields[2])),
                 model.add(name, portOf(fields[2])));
      break;
    case 'd':
      expectSame("deleteService", services.deleteService(name.c_str()), model.remove(name));
      break;
    case 'q':
      compareQueries(services, model, name);
      break;
    case 'p':
      comparePorts(services, model, portOf(name));
      break;
    case 'f':
      services.freeServicesEntries();
      model.forget();
      break;
    case 't':
      trcEvents = ~trcEvents;
      break;
    case 'w':  // another program adds this text
      writeTo(file, name, O_APPEND);
      model.write(name);
      break;
    case 'x':  // ... or removes the file
      unlink(file.c_str());
      model.removeFile();
      break;
    default:
      break;
  }
}

void compareFiles(const Files& files, const std::string& expected) {
  const bool has_file = access(files.file.c_str(), F_OK) == 0;
  expectSame("file", has_file ? contentsOf(files.file) : "", expected);
  if (access(files.backup.c_str(), F_OK) == 0) fail("backup", "it was left", "none");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const Files files;
  trcEvents = 0;
  const std::vector<std::string> parts =
      partsOf({reinterpret_cast<const char*>(data), size}, kRecordSeparator);
  ServicesModel model(parts[0]);
  writeTo(files.file, parts[0]);

  EtcServices services;
  for (size_t i = 0; i < parts.size(); ++i) {
    const std::string before = model.contents();
    takeStep(services, model, files.file, i == 0 ? "r" : parts[i]);
    const auto list = listOf(services);
    if (list != model.list()) fail("list", shownList(list), shownList(model.list()));
    if (model.contents() != before) compareFiles(files, model.contents());
  }
  compareFiles(files, model.contents());
  return 0;
}
