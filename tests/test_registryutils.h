// Fixture of the tests of installation paths.
#pragma once

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "owned.h"
#include "trails.h"
#include "world.h"

constexpr char kHome[] = "VRA_LDAP_HOME";

// ---- Expected records ----

inline Trail installPath() { return call("getVRAInstallPath", 0, call("getEnvVar", 0)); }
inline Trail exists(bool answer) {
  return answer ? call("doesFileExist", 1)
                : call("doesFileExist", 0, debug("doesFileExist: stat() - errno=2\n"));
}

// Returns a copy of the string and frees the original.
inline std::string taken(char* owned) {
  const osutils::OwnedString text(owned);
  return text ? text.get() : "(none)";
}

inline void expectBlocks(const LiveAllocations& live, int blocks) {
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), blocks);
  }
}

// Each test starts with the initial values of the globals and without VRA_LDAP_HOME. All are
// restored after it.
class Layout : public testing::Test {
 protected:
  Layout() {
    if (const char* const value = getenv(kHome)) home_ = value;
    unsetenv(kHome);
  }
  ~Layout() override {
    g_dirInstName = nullptr;
    g_dirInstLocation = nullptr;
    g_migBackDir = nullptr;
    g_isCallerVraImigr = 0;
    g_loadLocalXQ4Path = 0;
    rdbm_lib = default_rdbm_lib_;
    if (home_) {
      setenv(kHome, home_->c_str(), 1);
    } else {
      unsetenv(kHome);
    }
  }

  void setHome(const std::string& value) { setenv(kHome, value.c_str(), 1); }

 private:
  const char* const default_rdbm_lib_ = rdbm_lib;
  std::optional<std::string> home_;
};

inline Trail versionCheck(const std::string& version, bool answer) {
  return call("isVersionValid", answer ? 1 : 0,
              debug("isVersionValid: version received is " + version + "\n"));
}

// ---- getXQ4PathAndVersion ----

constexpr size_t kLongestLine = 1023;
constexpr size_t kBlock = 1024;  // the size of one read

// The outputs of one call. "(none)" stands for null, "(untouched)" for the value before the call.
struct Found {
  std::string path;
  std::string version;

  bool operator==(const Found&) const = default;
};
inline void PrintTo(const Found& found, std::ostream* out) {
  *out << "path " << found.path << ", version " << found.version;
}

// Repeats `line` up to `length` characters; the last repetition may be cut off.
inline std::string filled(const std::string& line, size_t length) {
  std::string text;
  while (text.size() < length) text += line;
  text.resize(length);
  return text;
}

// Returns lines of `length` characters in all, including the last newline.
inline std::string fillerLines(size_t length) {
  std::string lines = filled("# nothing of interest stands in this line\n", length);
  lines.back() = '\n';
  return lines;
}

class GetXQ4PathAndVersion : public Layout {
 protected:
  // Each creates the file of one situation and sets the globals for that situation.
  std::string migrationFile(const std::string& contents) {
    const std::string name = temp_.path("etc/xq4info");
    makeEtc(temp_.path());
    writeFile(name, contents);
    forMigration();
    return name;
  }
  void forMigration() {
    g_isCallerVraImigr = 1;
    g_migBackDir = temp_.path().c_str();
  }
  std::string instanceFile(const std::string& contents) {
    const std::string home = temp_.path("vraslapd-inst1");
    mkdir(home.c_str(), 0755);
    makeEtc(home);
    writeFile(home + "/etc/ldapdb.properties", contents);
    g_loadLocalXQ4Path = 1;
    g_dirInstName = "inst1";
    g_dirInstLocation = temp_.path().c_str();
    return home + "/etc/ldapdb.properties";
  }
  std::string installationFile(const std::string& contents) {
    makeEtc(temp_.path());
    writeFile(temp_.path("etc/ldapdb.properties"), contents);
    setHome(temp_.path());
    return temp_.path("etc/ldapdb.properties");
  }

  static Found find() {
    std::string untouched = "(untouched)";
    char* version = untouched.data();
    const int descriptors = openDescriptors();
    const osutils::OwnedString path(getXQ4PathAndVersion(&version));
    EXPECT_EQ(openDescriptors(), descriptors);
    Found found{path ? path.get() : "(none)", version != nullptr ? version : "(none)"};
    if (version != untouched.data()) free(version);
    return found;
  }
  // Passes no output for the version.
  static std::string findPath() {
    const int descriptors = openDescriptors();
    std::string path = taken(getXQ4PathAndVersion(nullptr));
    EXPECT_EQ(openDescriptors(), descriptors);
    return path;
  }
  // With a migration file of these contents.
  Found findIn(const std::string& contents) {
    migrationFile(contents);
    return find();
  }
  std::string findPathIn(const std::string& contents) {
    migrationFile(contents);
    return findPath();
  }

  // No test leaves a message for the user unread.
  void TearDown() override { EXPECT_EQ(takeCatalogueMessages().size(), 0U); }

  // Expects one message for the user, about this file.
  static void expectComplaint(const std::string& file) {
    const std::vector<CatalogueMessage> messages = takeCatalogueMessages();
    ASSERT_EQ(messages.size(), 1U);
    EXPECT_THAT(messages[0].arguments, testing::ElementsAre(20, 1, 53, 1, 1));
    EXPECT_EQ(messages[0].text, file);
  }

  const TempDir temp_;

 private:
  static void makeEtc(const std::string& parent) { mkdir((parent + "/etc").c_str(), 0755); }
};

constexpr char kPathLine[] = "currentXQ4InstallPath=/opt/xq4/V9.1/\n";
constexpr char kVersionLine[] = "currentXQ4Version=9.1.0.2\n";
inline const std::string kBothLines = std::string(kPathLine) + kVersionLine;
inline const Found kBothFound{"/opt/xq4/V9.1", "9.1.0.2"};
inline const Found kNothing{"(none)", "(untouched)"};

template <typename... Inner>
Trail discovery(const Inner&... inner) {
  return call("getXQ4PathAndVersion", 0, inner...);
}
inline Trail shortname() { return call("getShortname", 0); }
inline Trail readable() { return call("doesFileExist", 1); }
inline Trail accessible() { return call("canAccessFile", 1); }
// The records of a call that could read its file, whatever it found there.
inline Trail silence() { return discovery(readable(), accessible(), shortname()); }
inline Trail missing(const std::string& file) {
  return error("getXQ4PathAndVersion: the file " + file +
               " is either non-existent or is inaccessible\n");
}
