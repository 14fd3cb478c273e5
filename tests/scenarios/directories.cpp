// Directories, links and free space.

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

using Ends = std::vector<End>;
using Prepare = std::function<void()>;

void makeText() { makeFile("file", "text"); }
void makeFolder() { mkdir(path("folder"), 0755); }
void makeTree() {
  makeFolder();
  makeFile("folder/file", "text");
  mkdir(path("folder/folder"), 0755);
}
void makeLink(const char* target) { (void)!symlink(target, path("link")); }

std::string shownTree() { return shownFile("folder") + ", " + shownFile("folder/file"); }

// Sends to nowhere what a command prints to standard error during the call.
std::string withoutMessages(const std::function<std::string()>& call) {
  const int before = dup(STDERR_FILENO);
  if (before == -1) return call();  // it is closed, or no descriptor is left
  const int nowhere = open("/dev/null", O_WRONLY | O_CLOEXEC);
  dup2(nowhere, STDERR_FILENO);
  close(nowhere);
  std::string result = call();
  dup2(before, STDERR_FILENO);
  close(before);
  return result;
}

// ---- Paths ----

std::string workingDirectory() {
  char* const found = getCurrentWorkingDirectory();
  if (found == nullptr) return "null";
  const bool is_right = std::filesystem::current_path() == found;
  free(found);
  return is_right ? "right" : "wrong";
}

std::string trimmed(const char* whole) {
  if (whole == nullptr) {
    char* none = nullptr;
    const int rc = trimLastDirectory(&none);
    return shown(rc) + (none == nullptr ? ", null" : ", changed");
  }
  std::string copy = whole;
  char* text = copy.data();
  const int rc = trimLastDirectory(&text);
  return shown(rc) + ", \"" + text + "\"";
}

void addPaths(std::vector<Scenario>& all) {
  const auto add = [&](const char* symbol, const char* variant,
                       const std::function<std::string()>& run, const Ends& ends) {
    all.push_back({.name = std::string(symbol) + ", " + variant,
                   .symbols = {symbol},
                   .run = run,
                   .ends = ends});
  };
  add("getTempDir", "the copy", [] { return freed(getTempDir()); },
      {{kNothing, "\"/tmp\""}, {kMemory, "null"}});
  add("getSystemDrive", "the copy", [] { return freed(getSystemDrive()); },
      {{kNothing, "\"/\""}, {kMemory, "null"}});
  add("getLocalDrives", "the number", [] { return shown(getLocalDrives()); }, {{kNothing, "0"}});
  add("getShortname", "name", [] { return freed(getShortname("/a name/b")); },
      {{kNothing, "\"/a name/b\""}, {kMemory, "null"}});
  add("getShortname", "null", [] { return freed(getShortname(nullptr)); }, {{kNothing, "null"}});
  add("getCurrentWorkingDirectory", "the path", workingDirectory,
      {{kNothing, "right"}, {kDirectory, "null"}});

  const auto trim = [&](const char* variant, const char* whole, const char* result) {
    add("trimLastDirectory", variant, [=] { return trimmed(whole); }, {{kNothing, result}});
  };
  trim("two parts", "/usr/lib", "0, \"/usr\"");
  trim("one part", "/usr", "0, \"\"");
  trim("at the end", "usr/lib/", "0, \"usr/lib\"");
  trim("no slash", "name", "0, \"\"");
  trim("empty", "", "0, \"\"");
  trim("null path", nullptr, "0, null");
  add("trimLastDirectory", "null", [] { return shown(trimLastDirectory(nullptr)); },
      {{kNothing, "1"}});

  const auto space = [&](const char* variant, long needed, const char* where, const Ends& ends) {
    add(
        "isEnoughDriveSpace", variant,
        [=] {
          char* const place = where == nullptr  ? nullptr
                              : where[0] == '/' ? const_cast<char*>(where)
                                                : path(where);
          return shown(isEnoughDriveSpace(needed, place));
        },
        ends);
  };
  space("nothing needed", 0, ".", {{kNothing, "true"}, {kPrint | kStatus, "false"}});
  space("a negative number", LONG_MIN, ".", {{kNothing, "true"}, {kPrint | kStatus, "false"}});
  space("too much needed", LONG_MAX, ".", {{kNothing, "false"}});
  space("a full file system", 1, "/proc", {{kNothing, "false"}});
  space("missing path", 0, "missing", {{kNothing, "false"}});
  space("null", 0, nullptr, {{kNothing, "false"}});
}

// ---- Directories ----

void addDirectories(std::vector<Scenario>& all) {
  const Prepare nothing = [] {};
  const auto create = [&](const char* variant, const Prepare& prepare, const char* where,
                          const char* user, const char* group, const char* changed,
                          const Ends& ends) {
    all.push_back({.name = std::string("createDirectory ") + variant,
                   .symbols = {"createDirectory"},
                   .prepare = prepare,
                   .run =
                       [=] {
                         return withUmask([=] {
                           return shown(createDirectory(where == nullptr ? nullptr : path(where),
                                                        const_cast<char*>(user),
                                                        const_cast<char*>(group), 0704));
                         });
                       },
                   .state = [=] { return shownOwned(changed); },
                   .ends = ends});
  };
  const auto not_made = [](Ends ends) {
    ends.push_back({kStatus | kDirectory | kLookup | kLock | kOwner, "false, umask 22", "missing"});
    // Neither the owner could be set nor the directory be removed.
    ends.push_back({kStatus | kDirectory, "false, umask 22", "root:root 755 directory"});
    // Made by nobody, who cannot give it away.
    ends.push_back({kOwner, "true, umask 22", "nobody:nogroup 704 directory"});
    return ends;
  };
  create("for the process", nothing, "folder", nullptr, nullptr, "folder",
         not_made({{kNothing, "true, umask 22", "root:root 704 directory"}}));
  create("for a user", nothing, "folder", "daemon", nullptr, "folder",
         not_made({{kNothing, "true, umask 22", "daemon:daemon 704 directory"},
                   {kOwner, "true, umask 22", "root:root 704 directory"},  // tolerated for a path
                   // A group that is looked up without the lock is root's.
                   {kLock, "true, umask 22", "daemon:root 704 directory"},
                   {kStatus, "false, umask 22", "daemon:daemon 755 directory"}}));
  create("for a user and a group", nothing, "folder", "daemon", "bin", "folder",
         not_made({{kNothing, "true, umask 22", "daemon:bin 704 directory"},
                   {kOwner, "true, umask 22", "root:root 704 directory"},
                   {kLock, "true, umask 22", "daemon:root 704 directory"},
                   {kStatus, "false, umask 22", "daemon:bin 755 directory"}}));
  create("for an unknown user", nothing, "folder", "nosuchuser", nullptr, "folder",
         not_made({{kNothing, "false, umask 22", "missing"}}));
  create("for an unknown group", nothing, "folder", "daemon", "nosuchgroup", "folder",
         not_made({{kNothing, "false, umask 22", "missing"},
                   {kLock, "true, umask 22", "daemon:root 704 directory"}}));
  create("that exists", makeTree, "folder", nullptr, nullptr, "folder",
         {{kNothing, "false, umask 22", "root:root 755 directory"}});
  create("with the name of a file", makeText, "file", nullptr, nullptr, "file",
         {{kNothing, "false, umask 22", "root:root 644 text"}});
  create("without a parent", nothing, "folder/folder", nullptr, nullptr, "folder",
         {{kNothing, "false, umask 22", "missing"}});
  create("of null", nothing, nullptr, nullptr, nullptr, "folder",
         {{kNothing, "false, umask 22", "missing"}});

  const auto removal = [&](const char* symbol, const auto& function, const char* variant,
                           const Prepare& prepare, const char* where,
                           const std::function<std::string()>& state, const Ends& ends) {
    all.push_back({.name = std::string(symbol) + " " + variant,
                   .symbols = {symbol},
                   .prepare = prepare,
                   .run = [=] { return shown(function(where == nullptr ? nullptr : path(where))); },
                   .state = state,
                   .ends = ends});
  };
  const auto remove = [&](const char* variant, const Prepare& prepare, const char* where,
                          const std::function<std::string()>& state, const Ends& ends) {
    removal("deleteDirectory", deleteDirectory, variant, prepare, where, state, ends);
  };
  const auto nothing_changed = [] { return std::string(); };
  remove("of an empty directory", makeFolder, "folder", [] { return shownFile("folder"); },
         {{kNothing, "true", "missing"}, {kStatus | kDirectory, "false", "directory"}});
  remove("of a filled directory", makeTree, "folder", shownTree,
         {{kNothing, "false", "directory, 644 text"}});
  remove("of a file", makeText, "file", [] { return shownFile("file"); },
         {{kNothing, "false", "644 text"}});
  remove(
      "of a link to a directory",
      [] {
        makeFolder();
        makeLink("folder");
      },
      "link", [] { return shownFile("link") + ", " + shownFile("folder"); },
      {{kNothing, "false", "-> folder, directory"}});
  remove("of a missing directory", nothing, "folder", [] { return shownFile("folder"); },
         {{kNothing, "false", "missing"}});
  remove("of null", nothing, nullptr, nothing_changed, {{kNothing, "false"}});

  const auto remove_tree = [&](const char* variant, const Prepare& prepare, const char* where,
                               const std::function<std::string()>& state, const Ends& ends) {
    removal("deleteDirForcefully", deleteDirForcefully, variant, prepare, where, state, ends);
  };
  remove_tree("of a tree", makeTree, "folder", shownTree,
              {{kNothing, "true", "missing, missing"},
               {kStatus | kPrint | kProcess, "false", "directory, 644 text"},
               {kProcess, "false", "missing, missing"}});  // system() could not wait
  remove_tree("of a file", makeText, "file", [] { return shownFile("file"); },
              {{kNothing, "false", "644 text"}});
  remove_tree(
      "of a name that a shell interprets",
      [] {
        makeTree();
        mkdir(path("folder;"), 0755);
      },
      "folder;", [] { return shownTree() + ", " + shownFile("folder;"); },
      {{kNothing, "false", "directory, 644 text, directory"}});
  // The shell command fails: rm refuses to remove "." and says so.
  remove_tree("that the command refuses", makeTree, "folder/.", shownTree,
              {{kNothing, "false", "directory, 644 text"}});
  all.back().run = [run = all.back().run] { return withoutMessages(run); };
  remove_tree("of a missing directory", nothing, "folder", [] { return shownFile("folder"); },
              {{kNothing, "false", "missing"}});
  remove_tree("of null", nothing, nullptr, nothing_changed, {{kNothing, "false"}});
}

// ---- Links ----

void addLinks(std::vector<Scenario>& all) {
  const auto create = [&](const char* variant, const Prepare& prepare, const char* target,
                          const char* link, const Ends& ends) {
    all.push_back(
        {.name = std::string("createSymLink ") + variant,
         .symbols = {"createSymLink"},
         .prepare = prepare,
         .run =
             [=] { return shown(createSymLink(target, link == nullptr ? nullptr : path(link))); },
         .state = [] { return shownFile("link"); },
         .ends = ends});
  };
  const Prepare nothing = [] {};
  create("with a new name", nothing, "file", "link",
         {{kNothing, "0", "-> file"}, {kDirectory, "-1", "missing"}});
  create("with the name of a link", [] { makeLink("folder"); }, "file", "link",
         {{kNothing, "-1", "-> folder"}});
  create("to null", nothing, nullptr, "link", {{kNothing, "89", "missing"}});
  create("from null", nothing, "file", nullptr, {{kNothing, "89", "missing"}});

  const auto remove = [&](const char* variant, const Prepare& prepare, const char* link,
                          const std::function<std::string()>& state, const Ends& ends) {
    all.push_back(
        {.name = std::string("removeSymLink ") + variant,
         .symbols = {"removeSymLink"},
         .prepare = prepare,
         .run = [=] { return shown(removeSymLink(link == nullptr ? nullptr : path(link))); },
         .state = state,
         .ends = ends});
  };
  remove(
      "of a link",
      [] {
        makeText();
        makeLink("file");
      },
      "link", [] { return shownFile("link") + ", " + shownFile("file"); },
      {{kNothing, "0", "missing, 644 text"}, {kDirectory, "-1", "-> file, 644 text"}});
  remove("of a file", makeText, "file", [] { return shownFile("file"); },
         {{kNothing, "0", "missing"}, {kDirectory, "-1", "644 text"}});
  remove("of a directory", makeFolder, "folder", [] { return shownFile("folder"); },
         {{kNothing, "-1", "directory"}});
  remove("of a missing link", nothing, "link", [] { return shownFile("link"); },
         {{kNothing, "-1", "missing"}});
  remove("of null", nothing, nullptr, [] { return std::string(); }, {{kNothing, "89"}});
}

}  // namespace

std::vector<Scenario> directoryScenarios() {
  std::vector<Scenario> all;
  addPaths(all);
  addDirectories(all);
  addLinks(all);
  for (const char* const path : {"getTempDir", "getSystemDrive", "getShortname"}) {
    alwaysReports(all, path, kMemory);
  }
  alwaysReports(all, "getCurrentWorkingDirectory", kDirectory);
  alwaysReports(all, "isEnoughDriveSpace", kPrint | kStatus);
  alwaysReports(all, "createDirectory", kDirectory | kLookup);
  alwaysReports(all, "deleteDirectory", kStatus | kDirectory);
  alwaysReports(all, "deleteDirForcefully", kStatus | kProcess);
  alwaysReports(all, "createSymLink", kDirectory);
  alwaysReports(all, "removeSymLink", kDirectory);
  return all;
}

}  // namespace scenarios
