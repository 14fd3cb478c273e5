// The commands of the tool in surroundings that are really hostile: what a command does is what it does
// elsewhere, or it fails with a message and leaves the files as they were.
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
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
                const std::function<void()>& enter) {
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
    (void)close_range(STDERR_FILENO + 1, ~0U,
                      CLOSE_RANGE_CLOEXEC);  // those of whoever runs the tests
    enter();
  });
  surrounding.leave(disk);
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

// The loader needs a descriptor.
bool isNotLoaded(const Surrounding& surrounding, const Attempt& made) {
  return surrounding.name == "DescriptorsBelow3" && made.result.status == 127 &&
         made.result.out.empty() && made.after == made.before &&
         made.result.err.find("error while loading shared libraries") != std::string::npos;
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
  if (made.result.status == 0 && command.front() == "platform") return made.after == usual.after;
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

#ifdef SANITIZER_OWNS_MALLOC

// A sanitizer needs memory, descriptors and a process of its own.
std::vector<Surrounding> surroundingsOfTheTool() {
  std::vector<Surrounding> all = surroundings::all();
  std::erase_if(all, [](const Surrounding& each) {
    return each.limits_memory || each.few_descriptors || each.user != 0;
  });
  return all;
}

#else

void limitMemory(rlim_t bytes) {
  const rlimit limit = {bytes, bytes};
  (void)setrlimit(RLIMIT_AS, &limit);
}

// The address space with which the tool does its work, but hardly more.
rlim_t leastMemory() {
  constexpr rlim_t kPage = 4096;
  rlim_t too_little = 0;
  rlim_t enough = rlim_t{1} << 30;
  while (enough - too_little > kPage) {
    const rlim_t between = (too_little + enough) / 2;
    const Result result = osutils({"help"}, [&] { limitMemory(between); });
    (result.status == 0 ? enough : too_little) = between;
  }
  return enough;
}

// The surroundings of the library, but with limits of memory that are right for the tool: what others
// have taken is free again when a program is executed.
std::vector<Surrounding> surroundingsOfTheTool() {
  std::vector<Surrounding> all = surroundings::all();
  std::erase_if(all, [](const Surrounding& each) { return each.limits_memory; });
  const rlim_t least = leastMemory();
  for (const int more : {-128, -32, 0, 8, 16, 32, 64, 128, 256}) {  // KiB
    const rlim_t limit = least + static_cast<rlim_t>(more * 1024);
    all.push_back({.name = std::to_string(more) + " KiB more than the least memory",
                   .enter = [limit](const Disk&) { limitMemory(limit); },
                   .holds = [](const Disk&) { return true; }});
  }
  return all;
}

#endif

// Of the owner of the files, in usual surroundings.
Attempt usualAttempt(const Arguments& command, const Surrounding& surrounding, const Disk& disk) {
  return attempt(command, surrounding, disk, [&] {
    if (surrounding.user != 0 && (setgroups(0, nullptr) != 0 || setgid(surrounding.user) != 0 ||
                                  setuid(surrounding.user) != 0)) {
      _exit(125);
    }
  });
}

class Surroundings : public testing::TestWithParam<size_t> {};

TEST_P(Surroundings, LetTheCommandDoItsWorkOrFailCleanly) {
  REQUIRE_ROOT("for namespaces of its own");
  REQUIRE_OTHER_USERS();
  const Arguments& command = kCommands[GetParam()];
  EXPECT_EQ(surroundings::withDisk([&](const Disk& disk) {
              writeFile("/etc/hosts", "127.0.0.1 localhost\n");
              std::map<uid_t, Attempt> usual;
              for (const Surrounding& surrounding : surroundingsOfTheTool()) {
                SCOPED_TRACE(surrounding.name);
                const auto [known, is_new] = usual.try_emplace(surrounding.user);
                if (is_new) known->second = usualAttempt(command, surrounding, disk);
                const Attempt hostile =
                    attempt(command, surrounding, disk, [&] { surrounding.enter(disk); });
                EXPECT_TRUE(isAllowed(command, surrounding, hostile, known->second))
                    << shown(hostile) << "\nusually " << shown(known->second);
              }
              return testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

std::string nameOf(const testing::TestParamInfo<size_t>& info) {
  std::string name = std::to_string(info.param);
  for (const std::string& word : kCommands[info.param]) {
    if (word.find_first_not_of("abcdefghijklmnopqrstuvwxyz") == std::string::npos)
      name += "_" + word;
  }
  return name;
}

INSTANTIATE_TEST_SUITE_P(Of, Surroundings, testing::Range(size_t{0}, kCommands.size()), nameOf);

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
