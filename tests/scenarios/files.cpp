// Files: queries, operations, ownership.

#include <fcntl.h>
#include <malloc.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <fstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "osutils.h"
#include "scenario.h"
#include "world.h"

namespace scenarios {
namespace {

using Ends = std::vector<End>;
using Prepare = std::function<void()>;

constexpr size_t kPipeBytes = 5000;
constexpr size_t kLargeBytes = size_t{64} * 1024;

void makeText() { makeFile("file", "text"); }
void makeFolder() { mkdir(path("folder"), 0755); }
void makeFilledFolder() {
  makeFolder();
  makeFile("folder/file", "text");
}
void makeDanglingLink() { (void)!symlink(path("target"), path("link")); }

void makeSocket() {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  strncpy(address.sun_path, path("socket"), sizeof address.sun_path - 1);
  const int descriptor = socket(AF_UNIX, SOCK_STREAM, 0);
  (void)bind(descriptor, reinterpret_cast<sockaddr*>(&address), sizeof address);
  close(descriptor);
}

std::string pattern(size_t size) {
  std::string text(size, '\0');
  for (size_t i = 0; i < size; ++i) text[i] = static_cast<char>('a' + i % 23);
  return text;
}

// The mode of a copy of pattern() and how much of it there is: "604, 2048 bytes".
std::string shownCopy(size_t size) {
  const std::string copy = shownFile("copy");
  const size_t blank = copy.find(' ');
  if (blank == std::string::npos) return copy;
  const std::string text = copy.substr(blank + 1);
  if (!pattern(size).starts_with(text)) return "other bytes";
  return copy.substr(0, blank) + ", " + std::to_string(text.size()) + " bytes";
}

// ---- Queries ----

template <typename Function>
Scenario query(const char* symbol, Function function, const std::string& variant, Prepare prepare,
               const char* file, Ends ends, bool makes_file = false) {
  Scenario scenario = {
      .name = std::string(symbol) + ", " + variant,
      .symbols = {symbol},
      .prepare = std::move(prepare),
      .run = [=] { return shown(function(file == nullptr ? nullptr : path(file))); },
      .ends = std::move(ends)};
  if (makes_file) scenario.state = [=] { return shownFile(file); };
  return scenario;
}

void addQueries(std::vector<Scenario>& all) {
  const Prepare nothing = [] {};
  const auto exists = [&](const char* variant, const Prepare& prepare, const char* file,
                          const Ends& ends) {
    all.push_back(query("doesFileExist", doesFileExist, variant, prepare, file, ends));
  };
  exists("file", makeText, "file", {{kNothing, "true"}, {kStatus, "false"}});
  exists("directory", makeFolder, "folder", {{kNothing, "true"}, {kStatus, "false"}});
  exists("missing", nothing, "file", {{kNothing, "false"}});
  exists("dangling link", makeDanglingLink, "link", {{kNothing, "false"}});
  exists("null", nothing, nullptr, {{kNothing, "false"}});

  const auto accessible = [&](const char* variant, const Prepare& prepare, const char* file,
                              const Ends& ends) {
    all.push_back(query("canAccessFile", canAccessFile, variant, prepare, file, ends));
  };
  accessible("file", makeText, "file", {{kNothing, "true"}, {kStatus, "false"}});
  accessible("missing", nothing, "file", {{kNothing, "true"}, {kStatus, "false"}});
  accessible("null", nothing, nullptr, {{kNothing, "false"}});

  const auto directory = [&](const char* variant, const Prepare& prepare, const char* file,
                             const Ends& ends) {
    all.push_back(query("isDirectory", isDirectory, variant, prepare, file, ends));
  };
  directory("directory", makeFolder, "folder", {{kNothing, "true"}, {kStatus, "false"}});
  directory("socket", makeSocket, "socket", {{kNothing, "true"}, {kStatus, "false"}});
  directory("file", makeText, "file", {{kNothing, "false"}});
  directory("missing", nothing, "file", {{kNothing, "false"}});
  directory("null", nothing, nullptr, {{kNothing, "false"}});

  const auto regular = [&](const char* variant, const Prepare& prepare, const char* file,
                           const Ends& ends) {
    all.push_back(query("isFile", isFile, variant, prepare, file, ends));
  };
  regular("file", makeText, "file", {{kNothing, "true"}, {kStatus, "false"}});
  regular("socket", makeSocket, "socket", {{kNothing, "true"}, {kStatus, "false"}});
  regular("directory", makeFolder, "folder", {{kNothing, "false"}});
  regular("missing", nothing, "file", {{kNothing, "false"}});
  regular("null", nothing, nullptr, {{kNothing, "false"}});

  const auto writable = [&](const char* variant, const Prepare& prepare, const char* file,
                            const Ends& ends) {
    Scenario scenario =
        query("canWriteToFile", canWriteToFile, variant, prepare, file, ends, file != nullptr);
    scenario.run = [run = scenario.run] { return withUmask(run); };
    all.push_back(scenario);
  };
  writable("file", makeText, "file",
           {{kNothing, "true, umask 22", "644 text"}, {kOpen, "false, umask 22", "644 text"}});
  writable("missing", nothing, "file",
           {{kNothing, "true, umask 22", "644 "}, {kOpen, "false, umask 22", "missing"}});
  writable("directory", makeFolder, "folder", {{kNothing, "false, umask 22", "directory"}});
  writable("null", nothing, nullptr, {{kNothing, "false, umask 22"}});

  const auto checked = [&](const char* variant, const Prepare& prepare, const char* file,
                           const Ends& ends) {
    all.push_back(query("checkFilePerms", checkFilePerms, variant, prepare, file, ends));
  };
  checked("file", makeText, "file", {{kNothing, "0"}, {kStatus, "32"}, {kStatus, "50"}});
  // A directory whose second status fails counts as a file.
  checked("directory", makeFolder, "folder",
          {{kNothing, "19"}, {kStatus, "32"}, {kStatus, "50"}, {kStatus, "0"}});
  checked("missing", nothing, "file", {{kNothing, "32"}, {kStatus, "50"}});
  checked("null", nothing, nullptr, {{kNothing, "89"}});
}

// ---- Copies ----

std::string copy(const char* from, char* to) {
  return withUmask([=] { return shown(copyFile(from, to, nullptr, nullptr, 0604)); });
}

// What createFile leaves where there was no file, from its first step on.
const Ends kNotMade = {
    {kStatus, "false, umask 22", "missing"},
    {kOpen | kLookup | kLock | kOwner, "false, umask 26", "missing"},
    {kDirectory, "false, umask 26", "640 "},  // could not be removed
};

Ends joined(Ends first, const Ends& second) {
  first.insert(first.end(), second.begin(), second.end());
  return first;
}

Ends copyEnds(size_t size, std::vector<size_t> beginnings) {
  Ends ends = {{kNothing, "true, umask 26", "604, " + std::to_string(size) + " bytes"},
               {kStatus, "false, umask 22", "missing"},
               {kOpen | kLookup | kLock | kOwner, "false, umask 26", "missing"},
               {kDirectory, "false, umask 26", "640, 0 bytes"},
               {kOpen | kClose, "false, umask 26", "604, 0 bytes"}};
  for (const size_t beginning : beginnings) {
    ends.push_back(
        {kRead | kWrite, "true, umask 26", "604, " + std::to_string(beginning) + " bytes"});
  }
  return ends;
}

// Copies from a pipe, so block by block.
std::string copyFromPipe() {
  int ends[2];
  if (pipe(ends) != 0) throw std::runtime_error("pipe");
  const std::string text = pattern(kPipeBytes);
  const bool is_filled = write(ends[1], text.data(), text.size()) == ssize_t{kPipeBytes};
  close(ends[1]);
  const std::string source = "/proc/self/fd/" + std::to_string(ends[0]);
  const std::string result = copy(source.c_str(), path("copy"));
  close(ends[0]);
  return is_filled ? result : "no text in the pipe";
}

void addCopies(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const Prepare& prepare, const char* from,
                       const char* to, const char* changed, const Ends& ends) {
    all.push_back({.name = std::string("copyFile ") + variant,
                   .symbols = {"copyFile"},
                   .prepare = prepare,
                   .run =
                       [=] {
                         return copy(from == nullptr ? nullptr : path(from),
                                     to == nullptr ? nullptr : path(to));
                       },
                   .state = [=] { return shownFile(changed); },
                   .ends = ends,
                   .repeated = kRead});
  };
  add("to a new file", makeText, "file", "copy", "copy",
      joined({{kNothing, "true, umask 26", "604 text"},
              {kOpen | kClose, "false, umask 26", "604 "},
              {kWrite, "true, umask 26", "604 "}},
             kNotMade));
  add(
      "of an empty file to a new file", [] { makeFile("file", ""); }, "file", "copy", "copy",
      joined({{kNothing, "true, umask 26", "604 "}, {kOpen | kClose, "false, umask 26", "604 "}},
             kNotMade));
  all.push_back({.name = "copyFile of a large file",
                 .symbols = {"copyFile"},
                 .prepare = [] { makeFile("file", pattern(kLargeBytes)); },
                 .run = [] { return copy(path("file"), path("copy")); },
                 .state = [] { return shownCopy(kLargeBytes); },
                 .ends = copyEnds(kLargeBytes, {0}),
                 .repeated = kRead});
  Ends from_elsewhere = copyEnds(kLargeBytes, {0});
  from_elsewhere.push_back({kShell, "false, umask 22", "missing"});  // /etc is hidden
  all.push_back({.name = "copyFile from another file system",
                 .symbols = {"copyFile"},
                 .prepare = [] { writeFile(etcFile("osutils.copied"), pattern(kLargeBytes)); },
                 .run = [] { return copy("/etc/osutils.copied", path("copy")); },
                 .state = [] { return shownCopy(kLargeBytes); },
                 .ends = from_elsewhere,
                 .repeated = kRead});
  all.push_back({.name = "copyFile from a pipe",
                 .symbols = {"copyFile"},
                 .run = copyFromPipe,
                 .state = [] { return shownCopy(kPipeBytes); },
                 .ends = copyEnds(kPipeBytes, {0, 2048, 4096}),
                 .repeated = kRead});
  add("to an existing file",
      [] {
        makeText();
        makeFile("copy", "longer text", 0600);
      },
      "file", "copy", "copy",
      {{kNothing, "true, umask 22", "600 text"},
       {kStatus | kOpen, "false, umask 22", "600 longer text"},
       {kWrite, "true, umask 22", "600 "},
       // Taken for missing, and so made anew.
       {kStatus, "true, umask 26", "604 text"},
       {kStatus, "false, umask 26", "600 longer text"}});
  add("onto itself", makeText, "file", "file", "file",
      {{kNothing, "true, umask 22", "644 "},
       {kStatus | kOpen, "false, umask 22", "644 text"},
       {kStatus, "true, umask 26", "604 "},
       {kStatus, "false, umask 26", "644 text"}});
  // A directory whose status is unknown can be opened, but not read.
  add("of a directory", makeFolder, "folder", "copy", "copy",
      {{kNothing, "false, umask 22", "missing"},
       {kStatus, "true, umask 26", "604 "},
       {kStatus, "false, umask 26", "missing"}});
  add("to a directory",
      [] {
        makeText();
        makeFolder();
      },
      "file", "folder", "folder",
      {{kNothing, "false, umask 22", "directory"}, {kStatus, "false, umask 26", "directory"}});
  add("to a directory that is missing", makeText, "file", "folder/copy", "folder",
      {{kNothing, "false, umask 26", "missing"}, {kStatus, "false, umask 22", "missing"}});
  add("of a missing file", [] {}, "file", "copy", "copy",
      {{kNothing, "false, umask 22", "missing"}});
  add("from null", [] {}, nullptr, "copy", "copy", {{kNothing, "false, umask 22", "missing"}});
  add("to null", makeText, "file", nullptr, "file", {{kNothing, "false, umask 22", "644 text"}});
}

// ---- Creation and deletion ----

// A string that a function may take without const.
char* name(const char* text) { return const_cast<char*>(text); }

void addCreations(std::vector<Scenario>& all) {
  const auto add = [&](const std::string& variant, const Prepare& prepare, const char* file,
                       const char* user, const char* group,
                       const std::function<std::string()>& state, const Ends& ends) {
    all.push_back({.name = "createFile " + variant,
                   .symbols = {"createFile"},
                   .prepare = prepare,
                   .run =
                       [=] {
                         return withUmask([=] {
                           return shown(createFile(file == nullptr ? nullptr : path(file),
                                                   name(user), name(group), 0604));
                         });
                       },
                   .state = state,
                   .ends = ends});
  };
  const Prepare nothing = [] {};
  const auto own = [] { return shownFile("file"); };
  const auto owned = [] { return shownOwned("file"); };
  const Ends not_made = {
      {kStatus, "false, umask 22", "missing"},
      {kOpen | kLookup | kLock | kOwner, "false, umask 26", "missing"},
      {kDirectory, "false, umask 26", "root:root 640 "},
  };
  add("for the process", nothing, "file", nullptr, nullptr, own,
      joined({{kNothing, "true, umask 26", "604 "}, {kClose, "false, umask 26", "604 "}},
             kNotMade));
  const Ends of_daemon =
      joined({{kNothing, "true, umask 26", "daemon:daemon 604 "},
              {kClose, "false, umask 26", "daemon:daemon 604 "},
              {kDirectory, "false, umask 26", "daemon:daemon 640 "},  // no mode, and not removed
              // A group that is looked up without the lock is root's.
              {kLock, "true, umask 26", "daemon:root 604 "}},
             not_made);
  add("for a user", nothing, "file", "daemon", nullptr, owned, of_daemon);
  add("for a user and a group", nothing, "file", "daemon", "bin", owned,
      joined({{kNothing, "true, umask 26", "daemon:bin 604 "},
              {kClose, "false, umask 26", "daemon:bin 604 "},
              {kDirectory, "false, umask 26", "daemon:bin 640 "},
              {kLock, "true, umask 26", "daemon:root 604 "}},
             not_made));
  add("for an unknown user", nothing, "file", "nosuchuser", nullptr, owned,
      {{kNothing, "false, umask 26", "missing"},
       {kStatus, "false, umask 22", "missing"},
       {kDirectory, "false, umask 26", "root:root 640 "}});
  add("for an unknown group", nothing, "file", "daemon", "nosuchgroup", owned,
      {{kNothing, "false, umask 26", "missing"},
       {kStatus, "false, umask 22", "missing"},
       {kDirectory, "false, umask 26", "root:root 640 "},
       {kLock, "true, umask 26", "daemon:root 604 "}});

  // The old file under its other name shows whether it was changed.
  const auto both = [] { return shownFile("file") + ", was " + shownFile("old"); };
  const Prepare existing = [] {
    makeFile("old", "text", 0600);
    (void)!link(path("old"), path("file"));
  };
  add("in place of an existing file", existing, "file", nullptr, nullptr, both,
      {{kNothing, "true, umask 26", "604 , was 600 text"},
       {kStatus, "false, umask 22", "600 text, was 600 text"},
       {kOpen | kLookup | kLock | kOwner, "false, umask 26", "missing, was 600 text"},
       {kClose, "false, umask 26", "604 , was 600 text"},
       // Not removed, because its status is unknown or its name cannot be removed.
       {kStatus | kDirectory, "true, umask 26", "604 text, was 604 text"},
       {kStatus | kDirectory, "false, umask 26", "600 text, was 600 text"},
       {kDirectory, "false, umask 26", "640 , was 600 text"}});
  add("in place of a file for an unknown user", existing, "file", "nosuchuser", nullptr, both,
      {{kNothing, "false, umask 26", "missing, was 600 text"},
       {kStatus, "false, umask 22", "600 text, was 600 text"},
       {kStatus | kDirectory, "false, umask 26", "600 text, was 600 text"},
       {kDirectory, "false, umask 26", "640 , was 600 text"}});
  add("through a dangling link", makeDanglingLink, "link", nullptr, nullptr,
      [] {
        return std::string(shownFile("link").starts_with("-> ") ? "link" : "no link") + ", " +
               shownFile("target");
      },
      {{kNothing, "true, umask 26", "link, 604 "},
       {kStatus, "false, umask 22", "link, missing"},
       {kOpen, "false, umask 26", "link, missing"},
       {kLookup | kLock | kOwner, "false, umask 26", "no link, 640 "},
       {kDirectory, "false, umask 26", "link, 640 "},
       {kClose, "false, umask 26", "link, 604 "}});
  add("of the name of a directory", makeFilledFolder, "folder", nullptr, nullptr,
      [] { return shownFile("folder") + ", " + shownFile("folder/file"); },
      {{kNothing, "false, umask 26", "directory, 644 text"},
       {kStatus, "false, umask 22", "directory, 644 text"}});
  add("in a missing directory", nothing, "folder/file", nullptr, nullptr,
      [] { return shownFile("folder"); },
      {{kNothing, "false, umask 26", "missing"}, {kStatus, "false, umask 22", "missing"}});
  add("of null", nothing, nullptr, nullptr, nullptr, [] { return std::string(); },
      {{kNothing, "false, umask 22"}});
}

void addDeletions(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const Prepare& prepare, const char* file,
                       const std::function<std::string()>& state, const Ends& ends) {
    all.push_back({.name = std::string("deleteFile ") + variant,
                   .symbols = {"deleteFile"},
                   .prepare = prepare,
                   .run = [=] { return shown(deleteFile(file == nullptr ? nullptr : path(file))); },
                   .state = state,
                   .ends = ends});
  };
  add("of a file", makeText, "file", [] { return shownFile("file"); },
      {{kNothing, "true", "missing"}, {kDirectory, "false", "644 text"}});
  add(
      "of a link",
      [] {
        makeText();
        (void)!symlink("file", path("link"));
      },
      "link", [] { return shownFile("link") + ", " + shownFile("file"); },
      {{kNothing, "true", "missing, 644 text"}, {kDirectory, "false", "-> file, 644 text"}});
  add(
      "of a link to a directory",
      [] {
        makeFilledFolder();
        (void)!symlink("folder", path("link"));
      },
      "link", [] { return shownFile("link") + ", " + shownFile("folder/file"); },
      {{kNothing, "false", "-> folder, 644 text"}, {kStatus, "true", "missing, 644 text"}});
  add("of a directory", makeFilledFolder, "folder", [] { return shownFile("folder/file"); },
      {{kNothing, "false", "644 text"}});
  // remove() takes an empty directory whose status is unknown.
  add("of an empty directory", makeFolder, "folder", [] { return shownFile("folder"); },
      {{kNothing, "false", "directory"}, {kStatus, "true", "missing"}});
  add(
      "of a missing file", [] {}, "file", [] { return shownFile("file"); },
      {{kNothing, "false", "missing"}});
  add(
      "of null", [] {}, nullptr, [] { return std::string(); }, {{kNothing, "false"}});
}

// ---- Contents ----

void addContents(std::vector<Scenario>& all) {
  const auto clear = [&](const char* variant, const Prepare& prepare, const char* file,
                         const Ends& ends) {
    Scenario scenario = {.name = std::string("clearFile ") + variant,
                         .symbols = {"clearFile"},
                         .prepare = prepare,
                         .run =
                             [=] {
                               return withUmask([=] {
                                 return shown(clearFile(file == nullptr ? nullptr : path(file)));
                               });
                             },
                         .ends = ends,
                         .repeated = kLock};
    if (file != nullptr) scenario.state = [=] { return shownFile(file); };
    all.push_back(scenario);
  };
  clear("of a file", makeText, "file",
        {{kNothing, "true, umask 22", "644 "}, {kOpen | kWrite, "false, umask 22", "644 text"}});
  clear("of a missing file", [] {}, "file",
        {{kNothing, "true, umask 22", "600 "},
         {kOpen, "false, umask 22", "missing"},
         {kWrite, "false, umask 22", "600 "}});
  clear("of a directory", makeFolder, "folder", {{kNothing, "false, umask 22", "directory"}});
  clear("of null", [] {}, nullptr, {{kNothing, "false, umask 22"}});

  const auto read = [&](const char* variant, const Prepare& prepare, const char* file, size_t size,
                        const Ends& ends) {
    all.push_back({.name = std::string("readFile ") + variant,
                   .symbols = {"readFile"},
                   .prepare = prepare,
                   .run =
                       [=] {
                         char untouched = '\0';
                         char* contents = &untouched;
                         std::string result =
                             shown(readFile(file == nullptr ? nullptr : path(file), &contents));
                         if (contents == &untouched) return result + ", untouched";
                         if (contents == nullptr) return result + ", null";
                         result += malloc_usable_size(contents) < size
                                       ? ", too small"
                                       : ", \"" + std::string(contents, size) + "\"";
                         free(contents);
                         return result;
                       },
                   .ends = ends});
  };
  const Left open_file = {.blocks = 0, .descriptors = 1};
  const std::string text = pattern(100) + std::string("\0x", 2);
  read("of a file", [=] { makeFile("file", text); }, "file", text.size(),
       {{kNothing, "true, \"" + text + "\""},
        {kOpen, "false, untouched"},
        {kMemory | kRead, "false, null", "", open_file},
        {kRead, "false, null"},
        {kRead, "true, \"" + std::string(text.size(), '\0') + "\""}});
  const std::string large = pattern(kLargeBytes);
  read("of a large file", [=] { makeFile("file", large); }, "file", large.size(),
       {{kNothing, "true, \"" + large + "\""},
        {kOpen, "false, untouched"},
        {kMemory | kRead, "false, null", "", open_file},
        {kRead, "false, null"},
        {kRead, "true, \"" + std::string(large.size(), '\0') + "\""}});
  read("of an empty file", [] { makeFile("file", ""); }, "file", 0,
       {{kNothing, "true, \"\""},
        {kOpen, "false, untouched"},
        {kMemory | kRead, "false, null", "", open_file},
        {kRead, "false, null"}});
  // A directory whose status is unknown has a size on some file systems, which cannot be allocated, and is
  // empty on others.
  read("of a directory", makeFolder, "folder", 0,
       {{kNothing, "false, untouched"},
        {kStatus, "false, null", "", open_file},
        {kStatus, "true, \"\""}});
  read("of a missing file", [] {}, "file", 0, {{kNothing, "false, untouched"}});
  read("of null", [] {}, nullptr, 0, {{kNothing, "false, untouched"}});
}

void addNames(std::vector<Scenario>& all) {
  const auto add = [&](const char* variant, const char* whole, const char* result) {
    Scenario scenario = {.name = std::string("getFileNameFromPath, ") + variant,
                         .symbols = {"getFileNameFromPath"},
                         .run = [=] { return freed(getFileNameFromPath(whole)); },
                         .ends = {{kNothing, result}}};
    if (whole != nullptr) scenario.ends.push_back({kMemory, "null"});
    all.push_back(scenario);
  };
  add("slashes", "a/b/c", "\"c\"");
  add("backslashes", "C:\\dir\\f", "\"f\"");
  add("both", "a/b\\c", "\"b\\c\"");
  add("neither", "name", "\"name\"");
  add("at the end", "dir/", "\"\"");
  add("null", nullptr, "null");
}

// ---- Ownership ----

std::string shownOwners(const char* file) {
  char untouched[] = "untouched";
  char* owner = untouched;
  char* group = untouched;
  unsigned int mode = 0;
  const bool result = getFileOwnersAndPermissions(file, &owner, &group, &mode);
  if (owner == untouched && group == untouched && mode == 0) return shown(result) + ", untouched";
  char octal[16];
  snprintf(octal, sizeof octal, "%o", mode);
  std::string text = shown(result) + ", " + octal;
  for (char* each : {owner, group}) text += each == untouched ? " untouched" : " " + freed(each);
  return text;
}

// Makes a file whose group is `gid`. The system has a group whose record needs more than one step
// from 2048 bytes.
void makeFileOfGroup(gid_t gid) {
  const std::string groups = etcFile("group");
  if (contentsOf(groups).find("\nlarge:") == std::string::npos) {
    std::ofstream more(groups, std::ios::app);
    more << "large:x:54321:member";
    for (int number = 0; number < 700; ++number) more << ",member" << number;
    more << "\n";
  }
  makeText();
  (void)!chown(path("file"), 0, gid);
}

void addOwners(std::vector<Scenario>& all) {
  const auto get = [&](const char* variant, const Prepare& prepare, const char* file,
                       const Ends& ends) {
    all.push_back({.name = std::string("getFileOwnersAndPermissions, ") + variant,
                   .symbols = {"getFileOwnersAndPermissions"},
                   .prepare = prepare,
                   .run = [=] { return shownOwners(file == nullptr ? nullptr : path(file)); },
                   .ends = ends});
  };
  const auto failed = [](const Ends& more) {
    return joined(more, {{kStatus | kMemory | kLookup, "false, untouched"}});
  };
  const End buffer_left = {kMemory, "false, untouched", "", Left{.blocks = 1, .descriptors = 0}};
  get("file", makeText, "file",
      failed({{kNothing, "true, 100644 \"root\" \"root\""},
              {kMemory, "true, 100644 null \"root\""},
              {kMemory, "true, 100644 \"root\" null"},
              {kMemory, "true, 100644 null null"}}));
  get(
      "large group", [] { makeFileOfGroup(54321); }, "file",
      failed({{kNothing, "true, 100644 \"root\" \"large\""},
              {kMemory, "true, 100644 null \"large\""},
              {kMemory, "true, 100644 \"root\" null"},
              {kMemory, "true, 100644 null null"},
              buffer_left}));
  get("unknown owner",
      [] {
        makeText();
        (void)!chown(path("file"), 54321, 0);
      },
      "file", {{kNothing, "false, untouched"}});
  get("unknown group", [] { makeFileOfGroup(54322); }, "file",
      {{kNothing, "false, untouched"}, buffer_left});
  get("missing", [] {}, "file", {{kNothing, "false, untouched"}});
  get("null", [] {}, nullptr, {{kNothing, "false, untouched"}});

  const auto set = [&](const char* variant, const char* file, const char* user, const char* group,
                       const std::function<int(const char*)>& selector, const Ends& ends) {
    all.push_back({.name = std::string("setFileOwnersAndPermissions ") + variant,
                   .symbols = {"setFileOwnersAndPermissions"},
                   .prepare =
                       [] {
                         makeText();
                         (void)!symlink("file", path("link"));
                       },
                   .run =
                       [=] {
                         const int descriptor = selector(path("file"));
                         const std::string result = shown(setFileOwnersAndPermissions(
                             descriptor, file == nullptr ? nullptr : path(file), name(user),
                             name(group), 0604));
                         if (descriptor >= 0) close(descriptor);
                         return result;
                       },
                   .state = [] { return shownOwned("link") + ", " + shownOwned("file"); },
                   .ends = ends});
  };
  const auto descriptor = [](const char* file) { return open(file, O_RDONLY | O_CLOEXEC); };
  const auto by_path = [](const char*) { return int{FILE_DESC_USE_PATH}; };
  const auto by_link = [](const char*) { return int{FILE_DESC_USE_LINK_PATH}; };
  const auto link_and = [](const std::string& owner, const std::string& rest) {
    return owner + " -> file, " + rest;
  };
  const std::string unchanged = link_and("root:root", "root:root 644 text");
  const std::string of_bin = link_and("root:root", "daemon:bin 604 text");
  const std::string no_mode = link_and("root:root", "daemon:bin 644 text");
  // The group that is looked up without the lock is root's.
  const std::string of_root = link_and("root:root", "daemon:root 604 text");
  set("through a descriptor", "file", "daemon", "bin", descriptor,
      {{kNothing, "true", of_bin},
       {kLookup | kLock | kOwner, "false", unchanged},
       {kOwner, "false", no_mode},
       {kLock, "true", of_root}});
  set("through a path", "link", "daemon", "bin", by_path,
      {{kNothing, "true", of_bin},
       {kLookup | kLock | kOwner, "false", unchanged},
       {kOwner, "false", no_mode},
       // Tolerated for a path.
       {kOwner, "true", link_and("root:root", "root:root 604 text")},
       {kLock, "true", of_root}});
  set("of a link", "link", "daemon", "bin", by_link,
      {{kNothing, "true", link_and("daemon:bin", "root:root 644 text")},
       {kLookup | kLock | kOwner, "false", unchanged},
       {kLock, "true", link_and("daemon:root", "root:root 644 text")}});
  set("to a primary group", "file", "daemon", nullptr, by_path,
      {{kNothing, "true", link_and("root:root", "daemon:daemon 604 text")},
       {kLookup | kLock | kOwner, "false", unchanged},
       {kOwner, "false", link_and("root:root", "daemon:daemon 644 text")},
       {kOwner, "true", link_and("root:root", "root:root 604 text")},
       {kLock, "true", of_root}});
  set("to the user of the process", "file", nullptr, nullptr, by_path,
      {{kNothing, "true", link_and("root:root", "root:root 604 text")},
       {kLookup | kLock | kOwner, "false", unchanged}});
  set("to an unknown user", "file", "nosuchuser", nullptr, by_path,
      {{kNothing, "false", unchanged}});
  set("to an unknown group", "file", "daemon", "nosuchgroup", by_path,
      {{kNothing, "false", unchanged}, {kLock, "true", of_root}});
  set("to an empty group", "file", "daemon", "", by_path, {{kNothing, "false", unchanged}});
  set("of a missing file", "missing", nullptr, nullptr, by_path, {{kNothing, "false", unchanged}});
  set("of null", nullptr, nullptr, nullptr, by_path, {{kNothing, "false", unchanged}});
}

}  // namespace

std::vector<Scenario> fileScenarios() {
  std::vector<Scenario> all;
  addQueries(all);
  addCopies(all);
  addCreations(all);
  addDeletions(all);
  addContents(all);
  addNames(all);
  addOwners(all);
  for (const char* const query : {"doesFileExist", "isDirectory", "isFile"}) {
    alwaysReports(all, query, kStatus);
  }
  alwaysReports(all, "canWriteToFile", kOpen);
  alwaysReports(all, "copyFile", kOpen | kLookup | kOwner);
  alwaysReports(all, "createFile", kOpen | kLookup | kOwner | kClose);
  alwaysReports(all, "deleteFile", kDirectory);
  alwaysReports(all, "clearFile", kOpen | kWrite);
  alwaysReports(all, "readFile", kOpen | kMemory);
  alwaysReports(all, "getFileNameFromPath", kMemory);
  alwaysReports(all, "getFileOwnersAndPermissions", kStatus | kLookup);
  alwaysReports(all, "setFileOwnersAndPermissions", kLookup);
  return all;
}

}  // namespace scenarios
