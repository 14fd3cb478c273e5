// VRAOSUtils::EtcServices.

#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "edits.h"
#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

// More than two blocks of it are comments, so that several reads are needed.
EditedFile editedFile() {
  std::string comments;
  while (comments.size() < 5000) comments += "# a comment of the services file\n";
  const std::string alpha = "alpha\t1000/tcp\n";
  const std::string beta = "beta\t2000/tcp\n" + comments + "beta\t2001/udp\n";
  const std::string gamma = "  gamma 3000/udp alias # comment\n";
  const std::string contents = alpha + beta + gamma;
  return {.name = "services",
          .contents = contents,
          .added = contents + "delta\t4000/tcp\n",
          .deleted = alpha + comments + gamma,
          .list = "(alpha 1000 beta 2000 beta 2001 gamma 3000)",
          .list_begun = "(alpha 1000 beta 2000)",
          .list_added = "(delta 4000 alpha 1000 beta 2000 beta 2001 gamma 3000)",
          .list_deleted = "(alpha 1000 beta 2001 gamma 3000)"};
}

void usePaths() {
  EtcServices::ETC_SERVICES_FILE = path("services");
  EtcServices::ETC_SERVICES_FILE_BACKUP = path("services.save");
}

// The list is the last of the three members: a virtual table pointer and two pointers.
std::string shownList(const EtcServices& services) {
  const ServicesEntry* entry = nullptr;
  memcpy(&entry, reinterpret_cast<const char*>(&services) + 2 * sizeof(void*), sizeof entry);
  std::string shown = "(";
  for (; entry != nullptr; entry = entry->next) {
    shown +=
        (shown == "(" ? "" : " ") + std::string(entry->name) + " " + std::to_string(entry->port);
  }
  return shown + ")";
}

std::string result(int rc, const EtcServices& services) {
  return shown(rc) + " " + shownList(services);
}

// Calls with an object that has read the whole file.
std::string withList(const std::function<std::string(EtcServices&)>& call,
                     const std::string& list = editedFile().list) {
  usePaths();
  EtcServices services;
  const int rc = services.readEtcServices();
  if (rc != OSUTILS_SUCCESS || shownList(services) != list)
    return "not read: " + result(rc, services);
  return call(services);
}

std::string member(const std::string& name) { return "_ZN10VRAOSUtils11EtcServices" + name; }

struct DerivedServices : EtcServices {};

template <typename Services>
std::string constructed() {
  usePaths();
  Services services;
  return shownList(services);
}

void addLives(std::vector<Scenario>& all) {
  all.push_back({.name = "EtcServices, a variable",
                 .symbols = {member("C1Ev"), member("D1Ev")},
                 .run = constructed<EtcServices>,
                 .ends = {{kNothing, "()"}}});
  all.push_back({.name = "EtcServices, a base class",
                 .symbols = {member("C2Ev"), member("D2Ev")},
                 .run = constructed<DerivedServices>,
                 .ends = {{kNothing, "()"}}});
  all.push_back({.name = "EtcServices, a deleted object",
                 .symbols = {member("D0Ev")},
                 .prepare = [] { editedFile().make(); },
                 .run =
                     [] {
                       usePaths();
                       EtcServices* volatile services = new EtcServices;
                       const int rc = services->readEtcServices();
                       std::string shown = result(rc, *services);
                       delete services;
                       return shown;
                     },
                 .state = [] { return editedFile().shown(); },
                 .ends = editedFile().readEnds()});
}

void addReads(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const std::function<void()>& prepare, int times,
                       const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcServices::readEtcServices ") + variant,
                   .symbols = {member("15readEtcServicesEv")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         usePaths();
                         EtcServices services;
                         for (int time = 1; time < times; ++time) services.readEtcServices();
                         const int rc = services.readEtcServices();
                         return result(rc, services);
                       },
                   .state = [] { return editedFile().shown(); },
                   .ends = ends});
  };
  add(
      "of a file", [] { editedFile().make(); }, 1, editedFile().readEnds());
  add(
      "in place of a list", [] { editedFile().make(); }, 2, editedFile().readEnds());
  const std::string missing = "missing, no backup";
  add("of a missing file", [] {}, 1,
      {{kNothing, "32 ()", missing}, {kStatus, "50 ()", missing}, {kMemory, "89 ()", missing}});
  const std::string directory = "directory, no backup";
  add("of a directory", [] { mkdir(path("services"), 0755); }, 1,
      {{kNothing, "19 ()", directory},
       {kStatus, "32 ()", directory},
       {kStatus, "50 ()", directory},
       {kStatus, "0 ()", directory},  // taken for a file
       {kOpen, "53 ()", directory},
       {kMemory, "89 ()", directory}});
}

void addAdditions(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const char* name, int port,
                       const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcServices::addService ") + variant,
                   .symbols = {member("10addServiceEPKci")},
                   .prepare = [] { editedFile().make(); },
                   .run =
                       [=] {
                         return withList([=](EtcServices& services) {
                           const int rc = services.addService(name, port);
                           return result(rc, services);
                         });
                       },
                   .state = [] { return editedFile().shown(); },
                   .ends = ends});
  };
  add("with a new name", "delta", 4000, editedFile().addEnds());
  const auto refused = [](int code) {
    return editedFile().queryEnds(editedFile().result(code), "644 before, no backup");
  };
  add("with a listed name", "beta", 4000, refused(68));
  add("with a listed port", "delta", 2001, refused(52));
  add("with port 0", "delta", 0, refused(52));
  add("with port 400001", "delta", 400001, refused(52));
  add("with null", nullptr, 4000, refused(89));

  const auto add_unread = [&](const char* variant, const std::function<void()>& prepare,
                              const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcServices::addService ") + variant,
                   .symbols = {member("10addServiceEPKci")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         usePaths();
                         EtcServices services;
                         const int rc = services.addService("beta", 2000);
                         return result(rc, services);
                       },
                   .state = [] { return shownFile("services"); },
                   .ends = ends});
  };
  const std::string unfinished = "644 beta 2000/tcp";
  add_unread("without the list, to an unfinished line",
             [] { makeFile("services", "beta 2000/tcp"); },
             {{kNothing, "0 (beta 2000)", unfinished + "beta\t2000/tcp\n"},
              {kStatus, "32 ()", unfinished},
              {kStatus | kOpen, "50 ()", unfinished},
              {kMemory, "89 ()", unfinished},
              {kMemory | kPrint, "90 ()", unfinished},
              {kWrite, "0 (beta 2000)", unfinished}});
  add_unread("to a missing file", [] {},
             {{kNothing, "32 ()", "missing"},
              {kStatus, "50 ()", "missing"},
              {kMemory, "89 ()", "missing"}});
  add_unread("to a directory", [] { mkdir(path("services"), 0755); },
             {{kNothing, "19 ()", "directory"},
              {kStatus, "32 ()", "directory"},
              {kStatus, "50 ()", "directory"},
              {kMemory, "89 ()", "directory"},
              {kMemory, "90 ()", "directory"}});  // taken for a file
}

void addDeletions(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const std::function<void()>& prepare, const char* name,
                       const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcServices::deleteService ") + variant,
                   .symbols = {member("13deleteServiceEPKc")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         return withList([=](EtcServices& services) {
                           return withUmask([&] {
                             const int rc = services.deleteService(name);
                             return result(rc, services);
                           });
                         });
                       },
                   .state = [] { return editedFile().shown(); },
                   .ends = ends});
  };
  add(
      "of two lines", [] { editedFile().make(); }, "beta", editedFile().deleteEnds());
  add(
      "over an earlier backup",
      [] {
        editedFile().make();
        makeFile("services.save", EditedFile::kEarlierBackup, 0600);
      },
      "beta", editedFile().deleteEndsWithBackup());
  const auto refused = [](int code) {
    return editedFile().queryEnds(editedFile().result(code) + ", umask 22",
                                  "644 before, no backup");
  };
  add(
      "of a name that is not listed", [] { editedFile().make(); }, "alias", refused(32));
  add(
      "of null", [] { editedFile().make(); }, nullptr, refused(89));
}

void addQueries(std::vector<Scenario>& all) {
  const auto add = [&](const char* name, const char* symbol,
                       const std::function<std::string(EtcServices&)>& run, const char* result) {
    all.push_back({.name = std::string("EtcServices::") + name,
                   .symbols = {member(symbol)},
                   .prepare = [] { editedFile().make(); },
                   .run = [=] { return withList(run); },
                   .ends = editedFile().queryEnds(result)});
  };
  add(
      "doesServiceExist", "16doesServiceExistEPKc",
      [](EtcServices& services) {
        return shown(services.doesServiceExist("beta")) + " " +
               shown(services.doesServiceExist("Beta")) + " " +
               shown(services.doesServiceExist(nullptr));
      },
      "true false false");
  add(
      "getServicePort", "14getServicePortEPKc",
      [](EtcServices& services) {
        return shown(services.getServicePort("beta")) + " " +
               shown(services.getServicePort("alias")) + " " +
               shown(services.getServicePort(nullptr));
      },
      "2000 -1 -1");
  add(
      "isPortAvaliable", "15isPortAvaliableEi",
      [](EtcServices& services) {
        return shown(services.isPortAvaliable(2001)) + " " + shown(services.isPortAvaliable(2002)) +
               " " + shown(services.isPortAvaliable(0)) + " " +
               shown(services.isPortAvaliable(400001));
      },
      "false true false false");
  add(
      "findAvaliablePort", "17findAvaliablePortEi",
      [](EtcServices& services) {
        return shown(services.findAvaliablePort(-5)) + " " +
               shown(services.findAvaliablePort(2000)) + " " +
               shown(services.findAvaliablePort(400000)) + " " +
               shown(services.findAvaliablePort(400001));
      },
      "1 2002 400000 -1");
  add(
      "getServicesEntry", "16getServicesEntryEPKc",
      [](EtcServices& services) {
        const ServicesEntry* const beta = services.getServicesEntry("beta");
        return (beta == nullptr ? "null" : shown(beta->port)) + " " +
               (services.getServicesEntry("delta") == nullptr ? "null" : "a record") + " " +
               (services.getServicesEntry(nullptr) == nullptr ? "null" : "a record");
      },
      "2000 null null");
  add(
      "freeServicesEntries", "19freeServicesEntriesEv",
      [](EtcServices& services) {
        services.freeServicesEntries();
        services.freeServicesEntries();
        return shownList(services);
      },
      "()");
}

}  // namespace

std::vector<Scenario> servicesScenarios() {
  std::vector<Scenario> all;
  addLives(all);
  addReads(all);
  addAdditions(all);
  addDeletions(all);
  addQueries(all);
  for (Scenario& scenario : all) scenario.repeated = kRead;
  alwaysReports(all, member("10addServiceEPKci"), kOpen);
  alwaysReports(all, member("13deleteServiceEPKc"), kSync);
  return all;
}

}  // namespace scenarios
