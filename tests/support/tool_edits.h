// Tests of the commands that edit the services file and the inittab file.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <optional>
#include <ostream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

inline const char* const kServicesWithoutDomain =
    "# services of the test\n"
    "ssh\t22/tcp\t# remote shell\n"
    "ldap    389/tcp  directory\n";

struct Family {
  const char* name;
  const char* contents;
  Arguments addition;
  const char* added;
  Arguments deletion;
  const char* rest;
};
inline void PrintTo(const Family& family, std::ostream* stream) { *stream << family.name; }

inline const Family kFamilies[] = {
    {"services", kServices, {"new", "4000"}, "new\t4000/tcp\n", {"domain"}, kServicesWithoutDomain},
    {"inittab",
     kInittab,
     {"new", "2", "wait", "/x"},
     "new:2:wait:/x\n",
     {"l0"},
     "# inittab of the test\nid:2:initdefault:\nvra0:2345:respawn:/opt/a:b --x\n"}};

inline Arguments command(const std::string& family, const std::string& name,
                         const std::string& file, const Arguments& rest = {}) {
  Arguments arguments = {family, name, "--file", file};
  arguments.insert(arguments.end(), rest.begin(), rest.end());
  return arguments;
}

inline Result edit(
    const Family& family, const std::string& name, const std::string& file,
    const Arguments& options = {}, const std::function<void()>& prepare = [] {}) {
  Arguments rest = options;
  const Arguments& texts = name == "add" ? family.addition : family.deletion;
  rest.insert(rest.end(), texts.begin(), texts.end());
  return osutils(command(family.name, name, file, rest), prepare);
}

// Runs the command that a failure recommends in a shell, with the tool under test as "osutils" and with
// --yes.
inline Result runRecommended(const Result& failure) {
  const size_t begin = failure.err.rfind(": ");
  std::string line = failure.err.substr(begin == std::string::npos ? 0 : begin + 2);
  if (line.starts_with("osutils ")) {
    line = OSUTILS_TOOL + line.substr(strlen("osutils"), line.size() - strlen("osutils") - 1) +
           " --yes";
  }
  return runProgram({"/bin/sh", "-c", line});
}

inline void expectRefusal(const Result& result, const ::testing::Matcher<std::string>& line) {
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.out, "");
  EXPECT_THAT(result.err, line);
}

inline std::vector<std::string> linesOf(const std::string& path) {
  std::istringstream stream(contentsOf(path));
  std::vector<std::string> lines;
  for (std::string line; std::getline(stream, line);) lines.push_back(line);
  return lines;
}

// The entries of a folder with their modes, sizes and times.
inline std::string stateOf(const std::string& folder) {
  std::set<std::string> entries;
  for (const auto& entry : std::filesystem::directory_iterator(folder)) {
    struct stat status = {};
    lstat(entry.path().c_str(), &status);
    entries.insert(entry.path().string() + " " + std::to_string(status.st_mode) + " " +
                   std::to_string(status.st_size) + " " + std::to_string(status.st_mtim.tv_sec) +
                   "." + std::to_string(status.st_mtim.tv_nsec));
  }
  std::string text;
  for (const std::string& entry : entries) text += entry + "\n";
  return text;
}

inline void withFault(const char* fault) {
  setenv("LD_PRELOAD", EDIT_FAULTS, 1);
  setenv("ASAN_OPTIONS", "verify_asan_link_order=0:detect_odr_violation=0", 1);
  setenv("OSUTILS_TEST_FAULT", fault, 1);
  dropCoverageCounters();
}

// Another process that holds the lock until the end of the scope.
class LockHolder {
 public:
  // The record is "PROCESS COMMAND", with control characters in the command, or this text.
  explicit LockHolder(const std::string& lock,
                      const std::optional<std::string>& record = std::nullopt) {
    int ready[2];
    EXPECT_EQ(pipe2(ready, O_CLOEXEC), 0);
    child_ = fork();
    if (child_ == 0) {
      const int descriptor = open(lock.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
      struct flock whole = {};
      whole.l_type = F_WRLCK;
      const std::string text =
          record.value_or(std::to_string(getpid()) + " backup \033" + '\0' + " of files\n");
      const bool held =
          fcntl(descriptor, F_SETLK, &whole) == 0 &&
          write(descriptor, text.data(), text.size()) == static_cast<ssize_t>(text.size());
      (void)!write(ready[1], held ? "y" : "n", 1);
      for (;;) pause();
    }
    char answer = 0;
    close(ready[1]);
    EXPECT_EQ(read(ready[0], &answer, 1), 1);
    EXPECT_EQ(answer, 'y');
    close(ready[0]);
  }
  ~LockHolder() { release(); }
  LockHolder(const LockHolder&) = delete;
  LockHolder& operator=(const LockHolder&) = delete;

  pid_t process() const { return child_; }
  void release() {
    if (child_ == 0) return;
    kill(child_, SIGKILL);
    waitpid(child_, nullptr, 0);
    child_ = 0;
  }

 private:
  pid_t child_ = 0;
};

class Edits : public ::testing::TestWithParam<Family> {
 protected:
  const Family family = GetParam();
  const TempDir temp;
  const std::string file = temp.file("the file", family.contents);  // commands must quote it
  const std::string backup = file + ".vrasave";
  const std::string lock = file + ".lock";
  const std::string error = std::string("osutils: ") + family.name + " ";
};
