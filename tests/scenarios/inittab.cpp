// VRAOSUtils::EtcInittab.

#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "edits.h"
#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

// More than two blocks of it are comments, so that several reads are needed.
EditedFile editedFile() {
  std::string comments;
  while (comments.size() < 5000) comments += "# a comment of the inittab file\n";
  const std::string first = "vra0:35:respawn:/opt/a/bin/one -x\n";
  const std::string second =
      "1:2345:once:/sbin/getty 38400\n" + comments + "1:6:wait:/sbin/other:2\n";
  const std::string last = "  vra2:3:off:/opt/a/bin/three\n";
  const std::string contents = first + second + last;
  return {.name = "inittab",
          .contents = contents,
          .added = contents + "vra1:2:boot:/opt/a/bin/two\n",
          .deleted = first + comments + last,
          .list =
              "(vra0:35:respawn:/opt/a/bin/one -x, 1:2345:once:/sbin/getty 38400, "
              "1:6:wait:/sbin/other:2, vra2:3:off:/opt/a/bin/three)",
          .list_begun = "(vra0:35:respawn:/opt/a/bin/one -x, 1:2345:once:/sbin/getty 38400)",
          .list_added =
              "(vra1:2:boot:/opt/a/bin/two, vra0:35:respawn:/opt/a/bin/one -x, "
              "1:2345:once:/sbin/getty 38400, 1:6:wait:/sbin/other:2, "
              "vra2:3:off:/opt/a/bin/three)",
          .list_deleted =
              "(vra0:35:respawn:/opt/a/bin/one -x, 1:6:wait:/sbin/other:2, "
              "vra2:3:off:/opt/a/bin/three)"};
}

void usePaths() {
  EtcInittab::ETC_INITTAB_FILE = path("inittab");
  EtcInittab::ETC_INITTAB_FILE_BACKUP = path("inittab.save");
}

std::string shownEntry(const InittabEntry* entry) {
  if (entry == nullptr) return "null";
  return std::string(entry->id) + ":" + entry->runlevels + ":" + entry->action + ":" +
         entry->process;
}

// The list is the last of the three members: a virtual table pointer and two pointers.
std::string shownList(const EtcInittab& inittab) {
  const InittabEntry* entry = nullptr;
  memcpy(&entry, reinterpret_cast<const char*>(&inittab) + 2 * sizeof(void*), sizeof entry);
  std::string shown = "(";
  for (; entry != nullptr; entry = entry->next) {
    shown += (shown == "(" ? "" : ", ") + shownEntry(entry);
  }
  return shown + ")";
}

std::string result(int rc, const EtcInittab& inittab) {
  return shown(rc) + " " + shownList(inittab);
}

// Calls with an object that has read the whole file.
std::string withList(const std::function<std::string(EtcInittab&)>& call,
                     const std::string& list = editedFile().list) {
  usePaths();
  EtcInittab inittab;
  const int rc = inittab.readInittab();
  if (rc != OSUTILS_SUCCESS || shownList(inittab) != list)
    return "not read: " + result(rc, inittab);
  return call(inittab);
}

std::string member(const std::string& name) { return "_ZN10VRAOSUtils10EtcInittab" + name; }

struct DerivedInittab : EtcInittab {};

template <typename Inittab>
std::string constructed() {
  usePaths();
  Inittab inittab;
  return shownList(inittab);
}

void addLives(std::vector<Scenario>& all) {
  all.push_back({.name = "EtcInittab, a variable",
                 .symbols = {member("C1Ev"), member("D1Ev")},
                 .run = constructed<EtcInittab>,
                 .ends = {{kNothing, "()"}}});
  all.push_back({.name = "EtcInittab, a base class",
                 .symbols = {member("C2Ev"), member("D2Ev")},
                 .run = constructed<DerivedInittab>,
                 .ends = {{kNothing, "()"}}});
  all.push_back({.name = "EtcInittab, a deleted object",
                 .symbols = {member("D0Ev")},
                 .prepare = [] { editedFile().make(); },
                 .run =
                     [] {
                       usePaths();
                       EtcInittab* volatile inittab = new EtcInittab;
                       const int rc = inittab->readInittab();
                       std::string shown = result(rc, *inittab);
                       delete inittab;
                       return shown;
                     },
                 .state = [] { return editedFile().shown(); },
                 .ends = editedFile().readEnds()});
}

void addReads(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const std::function<void()>& prepare, int times,
                       const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcInittab::readInittab ") + variant,
                   .symbols = {member("11readInittabEv")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         usePaths();
                         EtcInittab inittab;
                         for (int time = 1; time < times; ++time) inittab.readInittab();
                         const int rc = inittab.readInittab();
                         return result(rc, inittab);
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
  add("of a directory", [] { mkdir(path("inittab"), 0755); }, 1,
      {{kNothing, "19 ()", directory},
       {kStatus, "32 ()", directory},
       {kStatus, "50 ()", directory},
       {kStatus, "0 ()", directory},  // taken for a file
       {kOpen, "53 ()", directory},
       {kMemory, "89 ()", directory}});
}

void addAdditions(std::vector<Scenario>& all) {
  struct Entry {
    const char* id;
    const char* runlevels;
    const char* action;
    const char* process;
  };
  const auto add = [&](const char* variant, const Entry& entry, const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcInittab::addInittabEntry ") + variant,
                   .symbols = {member("15addInittabEntryEPKcS2_S2_S2_")},
                   .prepare = [] { editedFile().make(); },
                   .run =
                       [=] {
                         return withList([=](EtcInittab& inittab) {
                           const int rc = inittab.addInittabEntry(entry.id, entry.runlevels,
                                                                  entry.action, entry.process);
                           return result(rc, inittab);
                         });
                       },
                   .state = [] { return editedFile().shown(); },
                   .ends = ends});
  };
  const char* const process = "/opt/a/bin/two";
  add("with a new id", {"vra1", "2", "boot", process}, editedFile().addEnds());
  const auto refused = [](int code) {
    return editedFile().queryEnds(editedFile().result(code), "644 before, no backup");
  };
  add("with a listed id", {"1", "2", "boot", process}, refused(68));
  add("with a null id", {nullptr, "2", "boot", process}, refused(89));
  add("with null run levels", {"vra1", nullptr, "boot", process}, refused(89));
  add("with a null action", {"vra1", "2", nullptr, process}, refused(89));
  add("with a null command", {"vra1", "2", "boot", nullptr}, refused(89));

  const auto add_unread = [&](const char* variant, const std::function<void()>& prepare,
                              const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcInittab::addInittabEntry ") + variant,
                   .symbols = {member("15addInittabEntryEPKcS2_S2_S2_")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         usePaths();
                         EtcInittab inittab;
                         const int rc = inittab.addInittabEntry("1", "2", "once", "x");
                         return result(rc, inittab);
                       },
                   .state = [] { return shownFile("inittab"); },
                   .ends = ends});
  };
  const std::string unfinished = "644 1:2:once:y";
  add_unread("without the list, to an unfinished line", [] { makeFile("inittab", "1:2:once:y"); },
             {{kNothing, "0 (1:2:once:x)", unfinished + "1:2:once:x\n"},
              {kStatus, "32 ()", unfinished},
              {kStatus | kOpen, "50 ()", unfinished},
              {kMemory, "89 ()", unfinished},
              {kMemory | kPrint, "90 ()", unfinished},
              {kWrite, "0 (1:2:once:x)", unfinished}});
  add_unread("to a missing file", [] {},
             {{kNothing, "32 ()", "missing"},
              {kStatus, "50 ()", "missing"},
              {kMemory, "89 ()", "missing"}});
  add_unread("to a directory", [] { mkdir(path("inittab"), 0755); },
             {{kNothing, "19 ()", "directory"},
              {kStatus, "32 ()", "directory"},
              {kStatus, "50 ()", "directory"},
              {kMemory, "89 ()", "directory"},
              {kMemory, "90 ()", "directory"}});  // taken for a file
}

void addDeletions(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const std::function<void()>& prepare, const char* id,
                       const std::vector<End>& ends) {
    all.push_back({.name = std::string("EtcInittab::deleteInittabEntry ") + variant,
                   .symbols = {member("18deleteInittabEntryEPKc")},
                   .prepare = prepare,
                   .run =
                       [=] {
                         return withList([=](EtcInittab& inittab) {
                           return withUmask([&] {
                             const int rc = inittab.deleteInittabEntry(id);
                             return result(rc, inittab);
                           });
                         });
                       },
                   .state = [] { return editedFile().shown(); },
                   .ends = ends});
  };
  add(
      "of two lines", [] { editedFile().make(); }, "1", editedFile().deleteEnds());
  add(
      "over an earlier backup",
      [] {
        editedFile().make();
        makeFile("inittab.save", EditedFile::kEarlierBackup, 0600);
      },
      "1", editedFile().deleteEndsWithBackup());
  const auto refused = [](int code) {
    return editedFile().queryEnds(editedFile().result(code) + ", umask 22",
                                  "644 before, no backup");
  };
  add(
      "of an id that is not listed", [] { editedFile().make(); }, "vra", refused(32));
  add(
      "of null", [] { editedFile().make(); }, nullptr, refused(89));
}

void addQueries(std::vector<Scenario>& all) {
  const auto add = [&](const char* name, const char* symbol,
                       const std::function<std::string(EtcInittab&)>& run, const char* result,
                       const std::vector<End>& more = {}) {
    all.push_back({.name = std::string("EtcInittab::") + name,
                   .symbols = {member(symbol)},
                   .prepare = [] { editedFile().make(); },
                   .run = [=] { return withList(run); },
                   .ends = editedFile().queryEnds(result)});
    for (const End& end : more) all.back().ends.push_back(end);
  };
  add(
      "doesInittabEntryExist", "21doesInittabEntryExistEPKc",
      [](EtcInittab& inittab) {
        return shown(inittab.doesInittabEntryExist("1")) + " " +
               shown(inittab.doesInittabEntryExist("VRA0")) + " " +
               shown(inittab.doesInittabEntryExist(nullptr));
      },
      "true false false");
  add(
      "isCommandRegistered", "19isCommandRegisteredEPKc",
      [](EtcInittab& inittab) {
        return shown(inittab.isCommandRegistered("bin/three")) + " " +
               shown(inittab.isCommandRegistered("bin/four")) + " " +
               shown(inittab.isCommandRegistered(nullptr));
      },
      "true false false");
  add(
      "getInittabEntry", "15getInittabEntryEPKc",
      [](EtcInittab& inittab) {
        return shownEntry(inittab.getInittabEntry("1")) + " " +
               shownEntry(inittab.getInittabEntry("2")) + " " +
               shownEntry(inittab.getInittabEntry(nullptr));
      },
      "1:2345:once:/sbin/getty 38400 null null");
  add(
      "getInittabEntryWithCommand", "26getInittabEntryWithCommandEPKc",
      [](EtcInittab& inittab) {
        return shownEntry(inittab.getInittabEntryWithCommand("/opt/a")) + " " +
               shownEntry(inittab.getInittabEntryWithCommand("/opt/b")) + " " +
               shownEntry(inittab.getInittabEntryWithCommand(nullptr));
      },
      "vra0:35:respawn:/opt/a/bin/one -x null null");
  add("getEntryInitIDWithCommand", "25getEntryInitIDWithCommandEPKc",
      [](EtcInittab& inittab) {
        return freed(inittab.getEntryInitIDWithCommand("three")) + " " +
               freed(inittab.getEntryInitIDWithCommand("four")) + " " +
               freed(inittab.getEntryInitIDWithCommand(nullptr));
      },
      "\"vra2\" null null", {{kMemory, "null null null"}});
  // An id that cannot be made is passed over.
  add("findAvaliableID", "15findAvaliableIDEv",
      [](EtcInittab& inittab) { return freed(inittab.findAvaliableID()); }, "\"vra1\"",
      {{kPrint, "\"vra3\""}, {kPrint, "null"}});
  add("findAvaliableID, all taken", "15findAvaliableIDEv", nullptr, "null");
  all.back().ends.push_back({kRead, "\"vra0\""});
  all.back().run = [] {
    usePaths();
    EtcInittab inittab;
    const int rc = inittab.readInittab();
    return rc == OSUTILS_SUCCESS ? freed(inittab.findAvaliableID())
                                 : "not read: " + result(rc, inittab);
  };
  all.back().prepare = [] {
    std::string lines;
    for (const char suffix : std::string("0123456789abcdefghijklmnopqrstuvwxyz")) {
      lines += std::string("vra") + suffix + ":2:boot:x\n";
    }
    makeFile("inittab", lines);
  };
  add(
      "freeInittabEntries", "18freeInittabEntriesEv",
      [](EtcInittab& inittab) {
        inittab.freeInittabEntries();
        inittab.freeInittabEntries();
        return shownList(inittab);
      },
      "()");
}

}  // namespace

std::vector<Scenario> inittabScenarios() {
  std::vector<Scenario> all;
  addLives(all);
  addReads(all);
  addAdditions(all);
  addDeletions(all);
  addQueries(all);
  for (Scenario& scenario : all) scenario.repeated = kRead;
  alwaysReports(all, member("15addInittabEntryEPKcS2_S2_S2_"), kOpen);
  alwaysReports(all, member("18deleteInittabEntryEPKc"), kSync);
  return all;
}

}  // namespace scenarios
