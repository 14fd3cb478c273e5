// The commands of the tool in surroundings that are really hostile: what a command does is what it does
// elsewhere, or it fails with a message and leaves the files as they were.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "surroundings.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using surroundings::Disk;
using surroundings::Surrounding;

// "@" stands for the directory.
const std::vector<Arguments> kCommands = {
    {"help"},
    {"services", "list", "--file", "@/services"},
    {"services", "port", "--file", "@/services", "ldap"},
    {"services", "free-port", "--file", "@/services"},
    {"services", "add", "--file", "@/services", "new", "4000"},
    {"services", "add", "--no-lock", "--file", "@/services", "new", "4000"},
    {"services", "delete", "--file", "@/services", "domain"},
    {"services", "delete", "--verbose", "--file", "@/services", "domain"},
    {"services", "restore", "--yes", "--file", "@/torso"},
    {"inittab", "list", "--file", "@/inittab"},
    {"inittab", "find", "--file", "@/inittab", "/opt"},
    {"inittab", "free-id", "--file", "@/inittab"},
    {"inittab", "add", "--file", "@/inittab", "new", "2", "wait", "/x"},
    {"inittab", "delete", "--file", "@/inittab", "l0"},
    {"inittab", "restore", "--yes", "--file", "@/torso"},
    {"paths"},
    {"db"},
    {"file", "stat", "@/file"},
    {"file", "check", "@/file"},
    {"file", "copy", "@/file", "@/new"},
    {"file", "copy", "--verbose", "@/file", "@/new"},
    {"file", "create", "@/new"},
    {"file", "create", "--verbose", "--owner", "root", "@/new"},
    {"file", "delete", "@/file"},
    {"file", "clear", "@/file"},
    {"file", "owner", "--owner", "root", "--group", "root", "--mode", "604", "@/file"},
    {"dir", "create", "@/new"},
    {"dir", "delete", "@/empty"},
    {"dir", "delete", "--force", "@/tree"},
    {"dir", "trim", "a/b/c"},
    {"space", "0", "@"},
    {"user", "exists", "root"},
    {"user", "valid", "root"},
    {"user", "home", "root"},
    {"user", "group", "root"},
    {"group", "exists", "root"},
    {"group", "members", "root"},
    {"group", "has", "root", "root"},
    {"name", "check", "inst1"},
    {"screen", "a", "b"},
    {"process", "start", "--launcher-dir", "@", "inst1"},
    {"process", "stop", "2000000000"},
    {"process", "status", "2000000000", "vraslapd"},
    {"platform"},
    {"module", "check", "libc.so.6", "malloc"},
    {"net", "addresses", "--localhost"},
    {"net", "check", "127.0.0.1"},
    {"net", "resolve", "localhost"},
    {"dn", "format", "cn = a , o = b"},
    {"dn", "compare", "cn=a", "CN = A"},
};

using Files = std::map<std::string, std::string>;  // names with types and contents, without locks

Files filesOf(const Disk& disk) {
  Files files;
  for (const auto& each : std::filesystem::recursive_directory_iterator(disk.work)) {
    const std::string name = each.path().string().substr(disk.work.size());
    if (name.ends_with(".lock")) continue;
    files[name] = each.is_regular_file() ? contentsOf(each.path()) : "";
  }
  return files;
}

void prepare(const Surrounding& surrounding, const Disk& disk) {
  clear(disk);
  const auto make = [&](const std::string& name, const std::string& contents) {
    writeFile(disk.work + "/" + name, contents);
  };
  for (const char* const directory : {"etc", "empty", "tree"}) {
    std::filesystem::create_directory(disk.work + "/" + directory);
  }
  make("tree/file", "text\n");
  make("file", "text\n");
  make("services", kServices);
  make("inittab", kInittab);
  make("torso", "# torso\n");
  make("torso.vrasave", kServices);
  make("etc/ldapdb.properties", "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=9.1\n");
  make("vrarun", "#!/bin/sh\nexit 0\n");
  (void)chmod((disk.work + "/vrarun").c_str(), 0755);
  handOver(surrounding, disk);
}

struct Attempt {
  Result result;
  Files before;
  Files after;
};

Attempt attempt(const Arguments& command, const Surrounding& surrounding, const Disk& disk,
                bool is_hostile) {
  prepare(surrounding, disk);
  Arguments arguments = command;
  for (std::string& argument : arguments) {
    if (argument.starts_with('@')) argument.replace(0, 1, disk.work);
  }
  Attempt made;
  made.before = filesOf(disk);
  made.result = osutils(arguments, [&] {
    (void)setenv("VRA_LDAP_HOME", disk.work.c_str(), 1);
    dropCoverageCounters();
    (void)alarm(60);
    if (is_hostile) surrounding.enter(disk);
  });
  if (is_hostile) surrounding.leave(disk);
  made.after = filesOf(disk);
  return made;
}

std::string shown(const Attempt& made) {
  std::string text = "status " + std::to_string(made.result.status) + ", out " + made.result.out +
                     ", err " + made.result.err;
  for (const auto& [name, contents] : made.after) {
    if (!made.before.contains(name) || made.before.at(name) != contents) {
      text += ", " + name + ": " + contents;
    }
  }
  for (const auto& [name, contents] : made.before) {
    if (!made.after.contains(name)) text += ", no " + name;
  }
  return text;
}

// The program was not loaded, or the C++ library ended it because it had no memory to throw an exception.
bool isNotLoaded(const Surrounding& surrounding, const Attempt& made) {
  const bool is_limited = surrounding.limits_memory || surrounding.few_descriptors;
  const bool was_killed =
      made.result.status == 1000 + SIGKILL || made.result.status == 1000 + SIGSEGV;
  const std::string& err = made.result.err;
  return is_limited && made.result.out.empty() && made.after == made.before &&
         ((surrounding.limits_memory && was_killed && err.empty()) ||
          (surrounding.limits_memory && made.result.status == 1000 + SIGABRT &&
           (err.empty() || err.starts_with("terminate called"))) ||
          (made.result.status == 127 &&
           err.find("error while loading shared libraries") != std::string::npos));
}

// A complete copy of an edited file is at a place that the message names, or the message says that a new
// copy is incomplete.
bool saysWhatIsLeft(const Attempt& made) {
  if (made.result.err.find("is incomplete") != std::string::npos) return true;
  return std::any_of(made.after.begin(), made.after.end(), [&](const auto& file) {
    const bool is_copy =
        file.first.ends_with(".vrasave") && (file.second == kServices || file.second == kInittab);
    return is_copy && made.result.err.find(file.first) != std::string::npos;
  });
}

bool isAllowed(const Arguments& command, const Surrounding& surrounding, const Attempt& made,
               const Attempt& usual) {
  const bool prints_errors = (surrounding.closed & (1U << STDERR_FILENO)) == 0;
  const std::string& err = made.result.err;
  if (made.result.status == usual.result.status && made.result.out == usual.result.out &&
      made.after == usual.after) {
    return true;
  }
  // The threads are not known to be NPTL if nothing can be asked.
  const bool may_differ = surrounding.user != 0 || command.front() == "platform";
  if (made.result.status == 0 && may_differ) return made.after == usual.after;
  const bool is_done_or_undone = made.after == made.before || made.after == usual.after;
  // Without accounts, there is none of that name.
  if (made.result.status == 1 && surrounding.name == "EmptyEtc")
    return is_done_or_undone && err.empty();
  if (made.result.status == 3) {
    const bool has_message = err.find("osutils: ") != std::string::npos && err.ends_with('\n');
    return (has_message || !prints_errors) && (is_done_or_undone || saysWhatIsLeft(made));
  }
  return isNotLoaded(surrounding, made);
}

Surrounding named(const std::string& name) {
  const std::vector<Surrounding> all = surroundings::all();
  return *std::find_if(all.begin(), all.end(),
                       [&](const Surrounding& each) { return each.name == name; });
}

class ToolSurroundings : public testing::TestWithParam<std::string> {};

TEST_P(ToolSurroundings, LetEveryCommandDoItsWorkOrFailCleanly) {
  REQUIRE_ROOT("for namespaces of its own");
  const Surrounding surrounding = named(GetParam());
  if (surrounding.user != 0) REQUIRE_OTHER_USERS();
#ifdef SANITIZER_OWNS_MALLOC
  if (surrounding.limits_memory || surrounding.few_descriptors || surrounding.user != 0) {
    GTEST_SKIP() << "the sanitizer needs memory, descriptors and a process of its own";
  }
#endif
  EXPECT_EQ(surroundings::withDisk([&](const Disk& disk) {
              writeFile("/etc/hosts", "127.0.0.1 localhost\n");
              for (const Arguments& command : kCommands) {
                SCOPED_TRACE(testing::PrintToString(command));
                const Attempt usual = attempt(command, surrounding, disk, false);
                const Attempt hostile = attempt(command, surrounding, disk, true);
                EXPECT_TRUE(isAllowed(command, surrounding, hostile, usual))
                    << shown(hostile) << "\nusually " << shown(usual);
              }
              return testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

std::vector<std::string> names() {
  std::vector<std::string> names;
  for (const Surrounding& each : surroundings::all()) names.push_back(each.name);
  return names;
}

INSTANTIATE_TEST_SUITE_P(Of, ToolSurroundings, testing::ValuesIn(names()),
                         [](const auto& each) { return each.param; });

// The lock is the first file that the tool opens.
TEST(ToolWithoutStandardErrorAndNullDevice, PrintsNothingToItsLock) {
  REQUIRE_ROOT("for namespaces of its own");
  EXPECT_EQ(surroundings::withDisk([](const Disk& disk) {
              const Surrounding surrounding = named("NoNullDevice");
              prepare(surrounding, disk);
              const std::string file = disk.work + "/services";
              const Result result =
                  osutils({"services", "delete", "--verbose", "--file", file, "domain"}, [&] {
                    dropCoverageCounters();
                    surrounding.enter(disk);
                    close(STDERR_FILENO);
                  });
              surrounding.leave(disk);
              EXPECT_EQ(result.status, 0);
              EXPECT_THAT(contentsOf(file + ".lock"),
                          testing::Not(testing::HasSubstr("doesFileExist")));
              return testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

}  // namespace
