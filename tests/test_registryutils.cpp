// Where the product is installed, and where the database that backs an instance is.

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <functional>
#include <optional>
#include <ostream>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#include "calls.h"
#include "faults.h"
#include "osutils.h"
#include "owned.h"
#include "records.h"
#include "world.h"

using osutils::OwnedString;
using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr char kHome[] = "VRA_LDAP_HOME";
constexpr char kDefaultRoot[] = "/opt/orx/ldap/V6.1";

// ---- What calls leave in the trace ----

Trail debug(const std::string& text) { return {"D " + text}; }
Trail error(const std::string& text) { return {"E " + text}; }
Trail installPath() { return call("getVRAInstallPath", 0, call("getEnvVar", 0)); }
Trail exists(bool answer) {
  return answer ? call("doesFileExist", 1)
                : call("doesFileExist", 0, debug("doesFileExist: stat() - errno=2\n"));
}

// The string, freed.
std::string taken(char* owned) {
  const OwnedString text(owned);
  return text ? text.get() : "(none)";
}

void expectBlocks(const LiveAllocations& live, int blocks) {
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), blocks);
  }
}

// Every test begins with the globals as a program finds them and without VRA_LDAP_HOME, and leaves
// everything as it was.
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

// ---- Globals ----

using Globals = Layout;

TEST_F(Globals, AreAByteForEachFlagAndAPointerForEachString) {
  static_assert(std::is_same_v<decltype(g_isCallerVraImigr), unsigned char>);
  static_assert(std::is_same_v<decltype(g_loadLocalXQ4Path), unsigned char>);
  static_assert(std::is_same_v<decltype(g_dirInstName), const char*>);
  static_assert(std::is_same_v<decltype(g_dirInstLocation), const char*>);
  static_assert(std::is_same_v<decltype(g_migBackDir), const char*>);
  static_assert(std::is_same_v<decltype(rdbm_lib), const char*>);

  EXPECT_EQ(g_isCallerVraImigr, 0);
  EXPECT_EQ(g_loadLocalXQ4Path, 0);
  EXPECT_EQ(g_dirInstName, nullptr);
  EXPECT_EQ(g_dirInstLocation, nullptr);
  EXPECT_EQ(g_migBackDir, nullptr);
  EXPECT_STREQ(rdbm_lib, "/lib64/libvradbutils.so");
}

// ---- getVRAInstallPath ----

using GetVRAInstallPath = Layout;

TEST_F(GetVRAInstallPath, IsTheProductsPlaceWhenTheVariableIsUnset) {
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(taken(getVRAInstallPath()), "/opt/orx/ldap/V6.1");

  EXPECT_EQ(records.trail(), installPath());
  expectBlocks(live, 0);
}

TEST_F(GetVRAInstallPath, IsTheValueOfTheVariableLessOneSeparator) {
  struct Case {
    const char* value;
    const char* root;
  };
  for (const auto& [value, root] : {Case{"/x", "/x"},
                                    {"/x/", "/x"},
                                    {"/x//", "/x/"},
                                    {"/x\\", "/x"},
                                    {"/x\\\\", "/x\\"},
                                    {"/x\\/", "/x\\"},
                                    {"/x/\\", "/x/"},
                                    {"/a//", "/a/"},
                                    {"/x/ ", "/x/ "},
                                    {"", ""},
                                    {"/", ""},
                                    {"\\", ""},
                                    {"//", "/"},
                                    {"relative/dir/", "relative/dir"},
                                    {"/100%s%n", "/100%s%n"},
                                    {"/\xc3\xbc/", "/\xc3\xbc"}}) {
    SCOPED_TRACE(value);
    setHome(value);
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(taken(getVRAInstallPath()), root);

    EXPECT_EQ(records.trail(), installPath());
    EXPECT_STREQ(getenv(kHome), value);
    expectBlocks(live, 0);
  }
}

TEST_F(GetVRAInstallPath, IsReadAfreshAtEveryCall) {
  setHome("/first");
  EXPECT_EQ(taken(getVRAInstallPath()), "/first");
  setHome("/second/");
  EXPECT_EQ(taken(getVRAInstallPath()), "/second");
  unsetenv(kHome);
  EXPECT_EQ(taken(getVRAInstallPath()), kDefaultRoot);
}

TEST_F(GetVRAInstallPath, TakesALongValueWhole) {
  const std::string value = "/" + std::string(100'000, 'v');
  setHome(value + "/");

  EXPECT_EQ(taken(getVRAInstallPath()), value);
}

TEST_F(GetVRAInstallPath, FallsBackWhenThePlatformHasNoValueToGive) {
  setHome("/set");
  const FailingCall platform(Call::ldap_getenv, ENOMEM);

  EXPECT_EQ(taken(getVRAInstallPath()), kDefaultRoot);

  EXPECT_EQ(platform.calls(), 1);
}

TEST_F(GetVRAInstallPath, CopiesTheDefaultOnlyWhenItIsNeeded) {
  REQUIRE_OWN_MALLOC();
  setHome("/set");
  const FailingCall copy(Call::strdup, ENOMEM);

  EXPECT_EQ(taken(getVRAInstallPath()), "/set");

  EXPECT_EQ(copy.calls(), 0);
}

TEST_F(GetVRAInstallPath, WithoutMemoryForTheDefaultIsNullAndSilent) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRAInstallPath(), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), installPath());
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetVRAInstallPath, GivesEachCallerAStringOfItsOwn) {
  const OwnedString first(getVRAInstallPath());
  const OwnedString second(getVRAInstallPath());

  EXPECT_NE(first.get(), second.get());
  first.get()[0] = 'x';
  EXPECT_STREQ(second.get(), kDefaultRoot);
}

// ---- getVRAVarBasePath ----

using GetVRAVarBasePath = Layout;

TEST_F(GetVRAVarBasePath, IsFixed) {
  setHome("/elsewhere");
  const FailingCall environment(Call::ldap_getenv, 0, kNever);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(taken(getVRAVarBasePath()), "/var/vraldap/V6.1");

  EXPECT_EQ(environment.calls(), 0);
  EXPECT_EQ(records.trail(), call("getVRAVarBasePath", 0));
  expectBlocks(live, 0);
}

TEST_F(GetVRAVarBasePath, WithoutMemoryIsNullAndSilent) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const Records records;

  EXPECT_EQ(getVRAVarBasePath(), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), call("getVRAVarBasePath", 0));
}

// ---- getVRABaseSchemaDirPath ----

using GetVRABaseSchemaDirPath = Layout;

TEST_F(GetVRABaseSchemaDirPath, AppendsTheVersionAsItStands) {
  struct Case {
    const char* version;
    const char* path;
  };
  for (const auto& [version, path] : {Case{"6.1", "/opt/orx/ldap/V6.1/etc/SchemaV6.1"},
                                      {"", "/opt/orx/ldap/V6.1/etc/SchemaV"},
                                      {"/6/", "/opt/orx/ldap/V6.1/etc/SchemaV/6/"},
                                      {"%s%n", "/opt/orx/ldap/V6.1/etc/SchemaV%s%n"}}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_EQ(taken(getVRABaseSchemaDirPath(version)), path);

    EXPECT_EQ(records.trail(), call("getVRABaseSchemaDirPath", 0, installPath()));
  }
}

TEST_F(GetVRABaseSchemaDirPath, LiesBelowTheInstallRoot) {
  setHome("/x/");
  EXPECT_EQ(taken(getVRABaseSchemaDirPath("3")), "/x/etc/SchemaV3");
  setHome("");
  EXPECT_EQ(taken(getVRABaseSchemaDirPath("3")), "/etc/SchemaV3");
}

TEST_F(GetVRABaseSchemaDirPath, OfANullVersionSaysSoBeforeAnythingElse) {
  const FailingCall environment(Call::ldap_getenv, 0, kNever);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRABaseSchemaDirPath(nullptr), nullptr);

  EXPECT_EQ(environment.calls(), 0);
  EXPECT_EQ(records.trail(), call("getVRABaseSchemaDirPath", 0,
                                  debug("getVRABaseSchemaDirPath: passed a NULL pointer.\n")));
  expectBlocks(live, 0);
}

TEST_F(GetVRABaseSchemaDirPath, KeepsTheInstallRootOfEveryCall) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;

  for (int calls = 1; calls <= 5; ++calls) {
    taken(getVRABaseSchemaDirPath("6.1"));
    EXPECT_EQ(live.blocks(), calls);
  }
  setHome("/x");
  taken(getVRABaseSchemaDirPath("6.1"));
  EXPECT_EQ(live.blocks(), 6);
}

TEST_F(GetVRABaseSchemaDirPath, WithoutAnInstallRootIsNullAndSilent) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRABaseSchemaDirPath("6.1"), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(records.trail(), call("getVRABaseSchemaDirPath", 0, installPath()));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetVRABaseSchemaDirPath, ThatCannotBeJoinedNamesAnotherGetterAndKeepsTheRoot) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRABaseSchemaDirPath("6.1"), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(), call("getVRABaseSchemaDirPath", 0, installPath(),
                                  debug("getVRAVarBasePath: vra_asprintf failed\n")));
  expectBlocks(live, 1);
}

// ---- getAdminLogsPath ----

using GetAdminLogsPath = Layout;

TEST_F(GetAdminLogsPath, HasANumberForEachFile) {
  EXPECT_EQ(ADMIN_LOG_XQ4, 0);
  EXPECT_EQ(ADMIN_LOG_XQ4_CMDS, 1);
  EXPECT_EQ(ADMIN_LOG_ADM, 2);
  const char* const paths[] = {"/var/vraldap/V6.1/vraadmxq4.log",
                               "/var/vraldap/V6.1/vraadmxq4cmds.log",
                               "/var/vraldap/V6.1/vraadm.log"};
  for (int type = 0; type < 3; ++type) {
    SCOPED_TRACE(type);
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(taken(getAdminLogsPath(type)), paths[type]);

    EXPECT_EQ(records.trail(), call("getAdminLogsPath", 0, call("getVRAVarBasePath", 0)));
    expectBlocks(live, 0);
  }
}

TEST_F(GetAdminLogsPath, IsNotMovedByTheVariable) {
  setHome("/elsewhere");

  EXPECT_EQ(taken(getAdminLogsPath(ADMIN_LOG_ADM)), "/var/vraldap/V6.1/vraadm.log");
}

TEST_F(GetAdminLogsPath, OfAnotherNumberSaysSoBeforeAnythingElse) {
  for (const int type : {3, 4, -1, 256, INT_MAX, INT_MIN}) {
    SCOPED_TRACE(type);
    const FailingCall copy(Call::strdup, 0, kNever);
    const FailingCall print(Call::vra_asprintf, 0, kNever);
    const Records records;

    EXPECT_EQ(getAdminLogsPath(type), nullptr);

    EXPECT_EQ(copy.calls() + print.calls(), 0);
    EXPECT_EQ(records.trail(), call("getAdminLogsPath", 0,
                                    debug("getAdminLogsPath:: Invalid file Type specified.\n")));
  }
}

TEST_F(GetAdminLogsPath, WithoutABaseSaysSo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Records records;

  EXPECT_EQ(getAdminLogsPath(ADMIN_LOG_ADM), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(records.trail(), call("getAdminLogsPath", 0, call("getVRAVarBasePath", 0),
                                  debug("getAdminLogsPath: Unable to get var bast path.\n")));
}

TEST_F(GetAdminLogsPath, ThatCannotBeJoinedSaysSoAndKeepsNothing) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getAdminLogsPath(ADMIN_LOG_ADM), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(), call("getAdminLogsPath", 0, call("getVRAVarBasePath", 0),
                                  debug("getAdminLogsPath: vra_asprintf failed\n")));
  expectBlocks(live, 0);
}

// ---- isRDBMComponentInstalled ----

using IsRDBMComponentInstalled = Layout;

Trail searching(const std::string& path) {
  return debug("isRDBMComponentInstalled: searching for file '" + path + "'.\n");
}

TEST_F(IsRDBMComponentInstalled, LooksBelowTheProductsPlace) {
  // Whatever this machine has there.
  const FailingCall query(Call::stat64, ENOENT);
  const LiveAllocations live;
  const Records records;

  EXPECT_FALSE(isRDBMComponentInstalled());

  ASSERT_TRUE(query.fired());
  EXPECT_EQ(records.trail(),
            call("isRDBMComponentInstalled", 0, installPath(),
                 searching("/opt/orx/ldap/V6.1/lib64/libvradbutils.so"), exists(false)));
  expectBlocks(live, 0);
}

TEST_F(IsRDBMComponentInstalled, IsTrueWhenTheLibraryExistsAndStoresNoCode) {
  const TempDir temp;
  temp.dir("lib64");
  const std::string library = temp.file("lib64/libvradbutils.so", "");
  setHome(temp.path() + "/");
  const LiveAllocations live;
  const Records records;

  const bool installed = isRDBMComponentInstalled();

  EXPECT_TRUE(installed);
  static_assert(sizeof installed == 1);
  EXPECT_EQ(records.trail(),
            call("isRDBMComponentInstalled", 0, installPath(), searching(library), exists(true)));
  expectBlocks(live, 0);
}

TEST_F(IsRDBMComponentInstalled, LooksForWhatTheProgramSays) {
  const TempDir temp;
  temp.dir("lib64");
  const std::string other = temp.file("lib64/other.so", "");
  setHome(temp.path());
  EXPECT_FALSE(isRDBMComponentInstalled());

  rdbm_lib = "/lib64/other.so";
  {
    const Records records;
    EXPECT_TRUE(isRDBMComponentInstalled());
    EXPECT_THAT(records.texts(),
                ElementsAre("isRDBMComponentInstalled: searching for file '" + other + "'.\n"));
  }
  rdbm_lib = "/lib64/third.so";
  EXPECT_FALSE(isRDBMComponentInstalled());
}

TEST_F(IsRDBMComponentInstalled, AddsNoSeparatorOfItsOwn) {
  const TempDir temp;
  temp.file("dir.so", "");
  setHome(temp.path("dir"));
  rdbm_lib = ".so";

  EXPECT_TRUE(isRDBMComponentInstalled());
}

TEST_F(IsRDBMComponentInstalled, TakesAnEmptyInstallRoot) {
  const TempDir temp;
  const std::string library = temp.file("any.so", "");
  setHome("");
  rdbm_lib = library.c_str();

  EXPECT_TRUE(isRDBMComponentInstalled());
}

TEST_F(IsRDBMComponentInstalled, IsTrueForADirectoryToo) {
  const TempDir temp;
  temp.dir("lib64");
  setHome(temp.path());
  rdbm_lib = "/lib64";

  EXPECT_TRUE(isRDBMComponentInstalled());
}

TEST_F(IsRDBMComponentInstalled, WithoutAnInstallRootSaysSo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Records records;

  EXPECT_FALSE(isRDBMComponentInstalled());

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(records.trail(),
            call("isRDBMComponentInstalled", 0, installPath(),
                 debug("isRDBMComponentInstalled: Unable to locate VRA install directory.\n")));
}

TEST_F(IsRDBMComponentInstalled, ThatCannotBeJoinedShowsTheNullPathAndAsksNoFurther) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const FailingCall query(Call::stat64, 0, kNever);
  const LiveAllocations live;
  const Records records;

  EXPECT_FALSE(isRDBMComponentInstalled());

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(query.calls(), 0);
  EXPECT_EQ(records.trail(),
            call("isRDBMComponentInstalled", 0, installPath(), searching("(null)")));
  expectBlocks(live, 0);
}

// ---- The directories of libraries and programs ----

using GetVRAInstallLibPath = Layout;
using GetVRAInstallSbinPath = Layout;
using GetVRAVrarunFilePath = Layout;

Trail sbinPath() { return call("getVRAInstallSbinPath", 0, installPath()); }

TEST_F(GetVRAInstallLibPath, LiesBelowTheInstallRoot) {
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(taken(getVRAInstallLibPath()), "/opt/orx/ldap/V6.1/lib64");

  EXPECT_EQ(records.trail(), call("getVRAInstallLibPath", 0, installPath()));
  setHome("");
  EXPECT_EQ(taken(getVRAInstallLibPath()), "/lib64");
  setHome("/x//");
  EXPECT_EQ(taken(getVRAInstallLibPath()), "/x//lib64");
  expectBlocks(live, 0);
}

TEST_F(GetVRAInstallLibPath, WithoutAnInstallRootSaysSo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Records records;

  EXPECT_EQ(getVRAInstallLibPath(), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(records.trail(), call("getVRAInstallLibPath", 0, installPath(),
                                  debug("getVRAInstallLibPath: Unable to find install path.\n")));
}

TEST_F(GetVRAInstallLibPath, ThatCannotBeJoinedSaysSoAndKeepsNothing) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRAInstallLibPath(), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(), call("getVRAInstallLibPath", 0, installPath(),
                                  debug("getVRAInstallLibPath: vra_asprintf failed.\n")));
  expectBlocks(live, 0);
}

TEST_F(GetVRAInstallSbinPath, LiesBelowTheInstallRoot) {
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(taken(getVRAInstallSbinPath()), "/opt/orx/ldap/V6.1/sbin");

  EXPECT_EQ(records.trail(), sbinPath());
  setHome("");
  EXPECT_EQ(taken(getVRAInstallSbinPath()), "/sbin");
  setHome("/x\\");
  EXPECT_EQ(taken(getVRAInstallSbinPath()), "/x/sbin");
  expectBlocks(live, 0);
}

TEST_F(GetVRAInstallSbinPath, WithoutAnInstallRootSaysSo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Records records;

  EXPECT_EQ(getVRAInstallSbinPath(), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(records.trail(), call("getVRAInstallSbinPath", 0, installPath(),
                                  debug("getVRAInstallSbinPath: Unable to find install path.\n")));
}

TEST_F(GetVRAInstallSbinPath, ThatCannotBeJoinedSaysSoAndKeepsNothing) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRAInstallSbinPath(), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(), call("getVRAInstallSbinPath", 0, installPath(),
                                  debug("getVRAInstallSbinPath: vra_asprintf failed.\n")));
  expectBlocks(live, 0);
}

TEST_F(GetVRAVrarunFilePath, LiesBelowTheDirectoryOfPrograms) {
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(taken(getVRAVrarunFilePath()), "/opt/orx/ldap/V6.1/sbin/64/vrarun");

  EXPECT_EQ(records.trail(), call("getVRAVrarunFilePath", 0, sbinPath()));
  setHome("");
  EXPECT_EQ(taken(getVRAVrarunFilePath()), "/sbin/64/vrarun");
  setHome("/x");
  EXPECT_EQ(taken(getVRAVrarunFilePath()), "/x/sbin/64/vrarun");
  expectBlocks(live, 0);
}

TEST_F(GetVRAVrarunFilePath, WithoutAnInstallRootBothSaySo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const Records records;

  EXPECT_EQ(getVRAVrarunFilePath(), nullptr);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(),
            call("getVRAVrarunFilePath", 0,
                 call("getVRAInstallSbinPath", 0, installPath(),
                      debug("getVRAInstallSbinPath: Unable to find install path.\n")),
                 debug("getVRAVrarunFilePath: Unable to find sbin path.\n")));
}

TEST_F(GetVRAVrarunFilePath, WithoutADirectoryOfProgramsBothSaySo) {
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRAVrarunFilePath(), nullptr);

  EXPECT_EQ(print.calls(), 1);
  EXPECT_EQ(records.trail(), call("getVRAVrarunFilePath", 0,
                                  call("getVRAInstallSbinPath", 0, installPath(),
                                       debug("getVRAInstallSbinPath: vra_asprintf failed.\n")),
                                  debug("getVRAVrarunFilePath: Unable to find sbin path.\n")));
  expectBlocks(live, 0);
}

TEST_F(GetVRAVrarunFilePath, ThatCannotBeJoinedSaysSoAndKeepsNothing) {
  const FailingCall print(Call::vra_asprintf, ENOMEM, 2);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(getVRAVrarunFilePath(), nullptr);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(), call("getVRAVrarunFilePath", 0, sbinPath(),
                                  debug("getVRAVrarunFilePath: vra_asprintf failed.\n")));
  expectBlocks(live, 0);
}

// ---- All of the layout ----

TEST_F(Layout, OfAPrintThatAnswersAnotherNegativeNumberIsGood) {
  const TempDir temp;
  temp.file("any.so", "");
  setHome(temp.path());
  rdbm_lib = "/any.so";
  const Records records;
  const OddPrint print(-2);

  EXPECT_EQ(taken(getVRABaseSchemaDirPath("1")), temp.path() + "/etc/SchemaV1");
  EXPECT_EQ(taken(getAdminLogsPath(ADMIN_LOG_XQ4)), "/var/vraldap/V6.1/vraadmxq4.log");
  EXPECT_EQ(taken(getVRAInstallLibPath()), temp.path() + "/lib64");
  EXPECT_EQ(taken(getVRAInstallSbinPath()), temp.path() + "/sbin");
  EXPECT_EQ(taken(getVRAVrarunFilePath()), temp.path() + "/sbin/64/vrarun");
  EXPECT_TRUE(isRDBMComponentInstalled());

  EXPECT_EQ(records.texts().size(), 1U);  // the search
}

TEST_F(Layout, WritesNoMessageWhileDebugIsOff) {
  const Records records(kAllEvents & ~kDebug);

  EXPECT_EQ(getVRABaseSchemaDirPath(nullptr), nullptr);
  EXPECT_EQ(getAdminLogsPath(3), nullptr);
  EXPECT_FALSE(isVersionValid("x"));

  EXPECT_THAT(records.prints(), IsEmpty());
  EXPECT_EQ(records.all().size(), 6U);
}

TEST_F(Layout, AnswersTheSameWithTracingOff) {
  const Records records(0);

  EXPECT_EQ(getVRABaseSchemaDirPath(nullptr), nullptr);
  EXPECT_EQ(getAdminLogsPath(3), nullptr);
  EXPECT_EQ(taken(getAdminLogsPath(2)), "/var/vraldap/V6.1/vraadm.log");
  EXPECT_EQ(taken(getVRAVrarunFilePath()), "/opt/orx/ldap/V6.1/sbin/64/vrarun");

  EXPECT_THAT(records.all(), IsEmpty());
}

// ---- isVersionValid ----

Trail versionCheck(const std::string& version, bool answer) {
  return call("isVersionValid", answer ? 1 : 0,
              debug("isVersionValid: version received is " + version + "\n"));
}

TEST(IsVersionValid, TakesOneToFourGroupsOfDigits) {
  for (const char* const version :
       {"0", "9", "42", "9.1", "9.1.0", "9.1.0.2", "00.00.00.00", "10.11.12.13", "1234567890",
        "99999999999999999999.1.0.123456789012345678901234567890"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_TRUE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, true));
  }
}

TEST(IsVersionValid, RefusesEverythingElse) {
  for (const char* const version :
       {"",       ".",        "..",        ".9",          "9.",          "9..1", "9...1",
        "9.1..2", "9.1.0..2", "9.1.0.2.3", "9.1.0.2.3.4", "1.2.3.4.x.5", "9.1a", "a9.1",
        "9a1",    "9.a.1",    "V9",        "a",           " 9.1",        "9.1 ", "9. 1",
        "9 1",    "9.1\r",    "9.1\n",     "9.1\t",       "9\0011",      "-9",   "+9",
        "9-1",    "9,1",      "9/1",       "9:1",         "0x9",         "9%s1", "%n"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_FALSE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, false));
  }
}

TEST(IsVersionValid, KnowsNoDigitsButTheTenOfAscii) {
  for (const char* const version : {"\xd9\xa9", "9.\xd9\xa1", "9\331\2411", "\xb2", "9.\xb9",
                                    "9\2631", "\xef\xbc\x99", "9.\xff.1", "9\2001"}) {
    SCOPED_TRACE(version);
    const Records records;

    EXPECT_FALSE(isVersionValid(version));

    EXPECT_EQ(records.trail(), versionCheck(version, false));
  }
}

TEST(IsVersionValid, TellsEveryByteAlone) {
  for (int byte = 1; byte < 256; ++byte) {
    const std::string version(1, static_cast<char>(byte));
    EXPECT_EQ(isVersionValid(version.c_str()), byte >= '0' && byte <= '9') << byte;
    const std::string inside = "9" + version + "1";
    EXPECT_EQ(isVersionValid(inside.c_str()), byte == '.' || (byte >= '0' && byte <= '9')) << byte;
  }
}

TEST(IsVersionValid, OfNullIsFalseWithoutAMessage) {
  const Records records;

  EXPECT_FALSE(isVersionValid(nullptr));

  EXPECT_EQ(records.trail(), call("isVersionValid", 0));
}

TEST(IsVersionValid, AnswersTheSameWithTracingOff) {
  const Records records(0);

  EXPECT_TRUE(isVersionValid("9.1.0.2"));
  EXPECT_FALSE(isVersionValid("9.1."));

  EXPECT_THAT(records.all(), IsEmpty());
}

// ---- getXQ4PathAndVersion ----

constexpr size_t kLongestLine = 1023;
constexpr size_t kBlock = 1024;  // what is read at once

// What one call gave. "(none)" is null, "(untouched)" what the caller had put there.
struct Found {
  std::string path;
  std::string version;

  bool operator==(const Found&) const = default;
};
void PrintTo(const Found& found, std::ostream* out) {
  *out << "path " << found.path << ", version " << found.version;
}

// `line` as often as it takes, and then a part of it, to be `length` characters long.
std::string filled(const std::string& line, size_t length) {
  std::string text;
  while (text.size() < length) text += line;
  text.resize(length);
  return text;
}

// `length` characters in lines, the newline of the last one included.
std::string fillerLines(size_t length) {
  std::string lines = filled("# nothing of interest stands in this line\n", length);
  lines.back() = '\n';
  return lines;
}

class GetXQ4PathAndVersion : public Layout {
 protected:
  // The file of each situation, and the situation for it.
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
    const OwnedString path(getXQ4PathAndVersion(&version));
    EXPECT_EQ(openDescriptors(), descriptors);
    Found found{path ? path.get() : "(none)", version != nullptr ? version : "(none)"};
    if (version != untouched.data()) free(version);
    return found;
  }
  // Without asking for the version.
  static std::string findPath() {
    const int descriptors = openDescriptors();
    std::string path = taken(getXQ4PathAndVersion(nullptr));
    EXPECT_EQ(openDescriptors(), descriptors);
    return path;
  }
  // ... in a migration file with these contents.
  Found findIn(const std::string& contents) {
    migrationFile(contents);
    return find();
  }
  std::string findPathIn(const std::string& contents) {
    migrationFile(contents);
    return findPath();
  }

  // What the user is told, when there is nothing to tell.
  void TearDown() override { EXPECT_EQ(takeCatalogueMessages().size(), 0U); }

  // The user was told about this file, once.
  static void expectComplaint(const std::string& file) {
    const std::vector<CatalogueMessage> messages = takeCatalogueMessages();
    ASSERT_EQ(messages.size(), 1U);
    EXPECT_THAT(messages[0].arguments, ElementsAre(20, 1, 53, 1, 1));
    EXPECT_EQ(messages[0].text, file);
  }

  const TempDir temp_;

 private:
  static void makeEtc(const std::string& parent) { mkdir((parent + "/etc").c_str(), 0755); }
};

constexpr char kPathLine[] = "currentXQ4InstallPath=/opt/xq4/V9.1/\n";
constexpr char kVersionLine[] = "currentXQ4Version=9.1.0.2\n";
const std::string kBothLines = std::string(kPathLine) + kVersionLine;
const Found kBothFound{"/opt/xq4/V9.1", "9.1.0.2"};
const Found kNothing{"(none)", "(untouched)"};

template <typename... Inner>
Trail discovery(const Inner&... inner) {
  return call("getXQ4PathAndVersion", 0, inner...);
}
Trail shortname() { return call("getShortname", 0); }
Trail readable() { return call("doesFileExist", 1); }
Trail accessible() { return call("canAccessFile", 1); }
// Whatever was found, or not, in a file that is there.
Trail silence() { return discovery(readable(), accessible(), shortname()); }
Trail missing(const std::string& file) {
  return error("getXQ4PathAndVersion: the file " + file +
               " is either non-existent or is inaccessible\n");
}

// ---- ... the whole way ----

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheMigrationFile) {
  migrationFile(kBothLines);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname()));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheInstancesFile) {
  instanceFile(kBothLines);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname()));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheInstallationsFile) {
  installationFile(kBothLines);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(records.trail(), discovery(installPath(), readable(), accessible(),
                                       versionCheck("9.1.0.2", true), shortname()));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, AnswersTheSameWithTracingOff) {
  migrationFile(kBothLines);
  const Records records(0);

  EXPECT_EQ(find(), kBothFound);
  g_migBackDir = nullptr;
  EXPECT_EQ(find(), kNothing);

  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST_F(GetXQ4PathAndVersion, WritesNoMessageWhileDebugIsOff) {
  forMigration();
  const Records records(kAllEvents & ~kDebug);

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), discovery(call("doesFileExist", 0)));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST_F(GetXQ4PathAndVersion, LeavesTheGlobalsAndTheFileAsTheyAre) {
  const std::string file = instanceFile(kBothLines);
  const std::string name = "inst1";
  g_dirInstName = name.c_str();

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(g_dirInstName, name.c_str());
  EXPECT_EQ(g_dirInstLocation, temp_.path().c_str());
  EXPECT_EQ(g_migBackDir, nullptr);
  EXPECT_EQ(g_isCallerVraImigr, 0);
  EXPECT_EQ(g_loadLocalXQ4Path, 1);
  EXPECT_EQ(name, "inst1");
  EXPECT_EQ(contentsOf(file), kBothLines);
}

TEST_F(GetXQ4PathAndVersion, ReadsTheFileAfreshAtEveryCall) {
  EXPECT_EQ(findIn(kBothLines), kBothFound);
  EXPECT_EQ(findIn("currentXQ4Version=10\ncurrentXQ4InstallPath=/new\n"), (Found{"/new", "10"}));
}

TEST_F(GetXQ4PathAndVersion, MayBeAskedByManyThreadsAtOnce) {
  installationFile(kBothLines);
  std::atomic<int> right = 0;
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&right] {
      for (int round = 0; round < 50; ++round) {
        char* version = nullptr;
        const OwnedString path(getXQ4PathAndVersion(&version));
        const OwnedString owned_version(version);
        if (path && version != nullptr && Found{path.get(), version} == kBothFound) ++right;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();

  EXPECT_EQ(right, 200);
}

// ---- ... which file ----

TEST_F(GetXQ4PathAndVersion, IsForMigrationWithAnyFlagButZero) {
  migrationFile("currentXQ4InstallPath=/migration\n");
  installationFile("currentXQ4InstallPath=/installation\n");
  for (int flag = 0; flag < 256; ++flag) {
    g_isCallerVraImigr = static_cast<unsigned char>(flag);
    EXPECT_EQ(findPath(), flag == 0 ? "/installation" : "/migration") << flag;
  }
}

TEST_F(GetXQ4PathAndVersion, IsForTheInstanceWithTheFlagOneOnly) {
  instanceFile("currentXQ4InstallPath=/instance\n");
  installationFile("currentXQ4InstallPath=/installation\n");
  for (int flag = 0; flag < 256; ++flag) {
    g_loadLocalXQ4Path = static_cast<unsigned char>(flag);
    EXPECT_EQ(findPath(), flag == 1 ? "/instance" : "/installation") << flag;
  }
}

TEST_F(GetXQ4PathAndVersion, PrefersTheMigrationToTheInstance) {
  instanceFile("currentXQ4InstallPath=/instance\n");
  migrationFile("currentXQ4InstallPath=/migration\n");

  EXPECT_EQ(g_loadLocalXQ4Path, 1);
  EXPECT_EQ(findPath(), "/migration");
}

TEST_F(GetXQ4PathAndVersion, AsksForTheInstallRootInNoOtherSituation) {
  const FailingCall environment(Call::ldap_getenv, 0, kNever);
  instanceFile("currentXQ4InstallPath=/instance\n");
  EXPECT_EQ(findPath(), "/instance");
  migrationFile("currentXQ4InstallPath=/migration\n");
  EXPECT_EQ(findPath(), "/migration");

  EXPECT_EQ(environment.calls(), 0);
}

TEST_F(GetXQ4PathAndVersion, JoinsTheNamesAsTheyStand) {
  forMigration();
  const std::string directory = temp_.path() + "//%s%n/";
  const std::string name = "%d inst/";
  const Records records;

  g_migBackDir = directory.c_str();
  EXPECT_EQ(find(), kNothing);
  g_isCallerVraImigr = 0;
  g_loadLocalXQ4Path = 1;
  g_dirInstName = name.c_str();
  g_dirInstLocation = directory.c_str();
  EXPECT_EQ(find(), kNothing);
  g_loadLocalXQ4Path = 0;
  setHome(directory);
  EXPECT_EQ(find(), kNothing);

  const std::vector<std::string> trail = records.trail();
  for (const std::string& file :
       {directory + "/etc/xq4info", directory + "/vraslapd-%d inst//etc/ldapdb.properties",
        temp_.path() + "//%s%n/etc/ldapdb.properties"}) {
    EXPECT_THAT(trail, testing::Contains(missing(file)[0]));
  }
}

TEST_F(GetXQ4PathAndVersion, OfEmptyNamesIsNoError) {
  const FailingCall query(Call::stat64, ENOENT, 1, 3);  // whatever this machine has there
  const Records records;

  g_dirInstName = "";
  g_dirInstLocation = "";
  g_loadLocalXQ4Path = 1;
  EXPECT_EQ(find(), kNothing);
  g_migBackDir = "";
  g_isCallerVraImigr = 1;
  EXPECT_EQ(find(), kNothing);
  g_isCallerVraImigr = g_loadLocalXQ4Path = 0;
  setHome("");
  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(query.calls(), 3);
  const std::vector<std::string> trail = records.trail();
  for (const char* const file :
       {"/vraslapd-/etc/ldapdb.properties", "/etc/xq4info", "/etc/ldapdb.properties"}) {
    EXPECT_THAT(trail, testing::Contains(missing(file)[0]));
  }
}

TEST_F(GetXQ4PathAndVersion, WithoutAMigrationDirectorySaysSoAndLooksNowhereElse) {
  instanceFile(kBothLines);
  installationFile(kBothLines);
  g_isCallerVraImigr = 1;
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(),
            discovery(error("Error - getXQ4PathAndVersion: g_migBackDir is NULL\n")));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, WithoutAnInstanceNameSaysSoAndLooksNowhereElse) {
  instanceFile(kBothLines);
  installationFile(kBothLines);
  g_dirInstName = nullptr;
  for (const char* const location : {temp_.path().c_str(), static_cast<const char*>(nullptr)}) {
    g_dirInstLocation = location;
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(find(), kNothing);

    EXPECT_EQ(records.trail(),
              discovery(error("getXQ4PathAndVersion: instance name not available\n")));
    expectBlocks(live, 0);
  }
}

TEST_F(GetXQ4PathAndVersion, WithoutAnInstanceLocationSaysSoAndLooksNowhereElse) {
  instanceFile(kBothLines);
  installationFile(kBothLines);
  g_dirInstLocation = nullptr;
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(),
            discovery(error("getXQ4PathAndVersion: instance location not available\n")));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, WithoutAnInstallRootSaysSo) {
  REQUIRE_OWN_MALLOC();
  const FailingCall copy(Call::strdup, ENOMEM);
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(print.calls(), 0);
  EXPECT_EQ(
      records.trail(),
      discovery(installPath(), error("getXQ4PathAndVersion: getVRAInstallPath returned NULL\n")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetXQ4PathAndVersion, WhoseMigrationFileCannotBeJoinedNamesAFunctionThatThereIsNot) {
  migrationFile(kBothLines);
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(records.trail(),
            discovery(error("Error - getXQ4PropertiesFile: vra_asprintf failed with rc=-1\n")));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, WhoseInstancesFileCannotBeJoinedSaysSo) {
  instanceFile(kBothLines);
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(
      records.trail(),
      discovery(error("Error - getXQ4PathAndVersion: vra_asprintf failed. return code= -1 \n")));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, WhoseInstallationsFileCannotBeJoinedSaysSoAndKeepsNothing) {
  installationFile(kBothLines);
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(
      records.trail(),
      discovery(installPath(),
                error("Error - getXQ4PathAndVersion: vra_asprintf failed. return code= -1 \n")));
  expectBlocks(live, 0);
}

// Each situation in turn.
class EverySituation : public GetXQ4PathAndVersion {
 protected:
  void inEach(const std::function<void(const std::string& file, const Trail& before)>& body) {
    {
      SCOPED_TRACE("installation");
      const std::string file = installationFile(kBothLines);
      body(file, installPath());
    }
    {
      SCOPED_TRACE("instance");
      const std::string file = instanceFile(kBothLines);
      body(file, {});
    }
    SCOPED_TRACE("migration");
    const std::string file = migrationFile(kBothLines);
    body(file, {});
  }
};

TEST_F(EverySituation, TakesAPrintThatAnswersAnotherNegativeNumber) {
  inEach([](const std::string&, const Trail&) {
    const OddPrint print(-2);
    const LiveAllocations live;

    EXPECT_EQ(find(), kBothFound);

    expectBlocks(live, 0);
  });
}

TEST_F(EverySituation, SaysThatAGoodPrintLeftNoName) {
  inEach([](const std::string&, const Trail& before) {
    const OddPrint print(8, OddPrint::kNull);
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(find(), kNothing);

    EXPECT_EQ(records.trail(), discovery(before, error("getXQ4PathAndVersion: path2 is NULL\n")));
    expectBlocks(live, 0);
  });
}

TEST_F(EverySituation, NamesTheFileThatIsMissing) {
  inEach([](const std::string& file, const Trail& before) {
    ASSERT_EQ(unlink(file.c_str()), 0);
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(find(), kNothing);

    EXPECT_EQ(records.trail(), discovery(before, exists(false), missing(file)));
    EXPECT_FALSE(pathExists(file));
    expectBlocks(live, 0);
  });
}

TEST_F(EverySituation, ComplainsToTheUserAboutItsFile) {
  inEach([](const std::string& file, const Trail&) {
    writeFile(file, "currentXQ4Version=9.x\n");

    EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

    expectComplaint(file);
  });
}

// ---- ... a file that cannot be read ----

TEST_F(GetXQ4PathAndVersion, LooksBelowTheProductsPlaceWhenNothingIsSet) {
  const FailingCall query(Call::stat64, ENOENT);  // whatever this machine has there
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(query.fired());
  EXPECT_EQ(records.trail(), discovery(installPath(), exists(false),
                                       missing("/opt/orx/ldap/V6.1/etc/ldapdb.properties")));
}

TEST_F(GetXQ4PathAndVersion, OfAFileInADirectoryThatMayNotBeSearchedSaysSo) {
  REQUIRE_ROOT("to become another user");
  const std::string file = migrationFile(kBothLines);
  ASSERT_EQ(chmod(temp_.path("etc").c_str(), 0700), 0);

  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     const Records records;
                     EXPECT_EQ(find(), kNothing);
                     EXPECT_EQ(records.trail(),
                               discovery(call("doesFileExist", 0,
                                              debug("doesFileExist: stat() - errno=13\n")),
                                         missing(file)));
                     return 0;
                   }),
            0);
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatPermissionsHideAfterAllSaysSo) {
  const std::string file = migrationFile(kBothLines);
  const FailingCall query(Call::stat64, EACCES, 2);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(query.fired());
  EXPECT_EQ(
      records.trail(),
      discovery(readable(), call("canAccessFile", 0, debug("canAccessFile: stat() - errno=13\n")),
                missing(file)));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatDisappearsBeforeItIsOpenedIsNullAndSilent) {
  const std::string file = migrationFile(kBothLines);
  const BeforeCall opening(Call::fopen64, [&] { unlink(file.c_str()); });
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(opening.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, OfAFileThatMayNotBeReadIsNullAndSilent) {
  REQUIRE_ROOT("to become another user");
  const std::string file = migrationFile(kBothLines);
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);

  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     const Records records;
                     EXPECT_EQ(find(), kNothing);
                     EXPECT_EQ(records.trail(), silence());
                     return 0;
                   }),
            0);
}

TEST_F(GetXQ4PathAndVersion, ThatCannotOpenItsFileIsNullAndSilent) {
  migrationFile(kBothLines);
  for (const int reason : {ENOMEM, EMFILE, EIO}) {
    const FailingCall opening(Call::fopen64, reason);
    const Records records;

    EXPECT_EQ(find(), kNothing);

    ASSERT_TRUE(opening.fired());
    EXPECT_EQ(records.trail(), silence());
  }
}

TEST_F(GetXQ4PathAndVersion, OfADirectoryInTheFilesPlaceIsNullAndSilent) {
  temp_.dir("etc");
  temp_.dir("etc/xq4info");
  forMigration();
  const Records records;

  EXPECT_EQ(find(), kNothing);
  EXPECT_EQ(findPath(), "(none)");

  EXPECT_EQ(records.trail(), joined(silence(), silence()));
}

TEST_F(GetXQ4PathAndVersion, FollowsALinkToItsFile) {
  temp_.dir("etc");
  const std::string target = temp_.file("elsewhere", kBothLines);
  ASSERT_EQ(symlink(target.c_str(), temp_.path("etc/xq4info").c_str()), 0);
  forMigration();

  EXPECT_EQ(find(), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, KeepsItsFileFromProgramsThatAreStartedMeanwhile) {
  migrationFile(kBothLines);
  int descriptors = 0;
  const BeforeCall closing(Call::fclose, [&] {
    for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;  // the iterator's own
      if (std::filesystem::read_symlink(each, gone) != temp_.path("etc/xq4info")) continue;
      ++descriptors;
      const int descriptor = std::stoi(each.path().filename());
      EXPECT_EQ(fcntl(descriptor, F_GETFD), FD_CLOEXEC);
    }
  });

  EXPECT_EQ(find(), kBothFound);

  ASSERT_TRUE(closing.fired());
  EXPECT_EQ(descriptors, 1);
}

TEST_F(GetXQ4PathAndVersion, ThatCannotReadAtAllIsNullAndSilent) {
  migrationFile(kBothLines);
  const FailingCall reading(Call::fread, EIO);
  const Records records;

  EXPECT_EQ(find(), kNothing);

  ASSERT_TRUE(reading.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALineThatAReadErrorCuts) {
  // "9.1" would do, and so would "/opt/xq", had they been the whole line.
  const std::string cut_version = "currentXQ4Version=9.1";
  migrationFile(kPathLine + fillerLines(kBlock - strlen(kPathLine) - cut_version.size()) +
                cut_version + ".0.2\n");
  {
    const FailingCall reading(Call::fread, EIO, 2);
    EXPECT_EQ(find(), kNothing);
    ASSERT_TRUE(reading.fired());
  }
  EXPECT_EQ(find(), kBothFound);

  const std::string cut_path = "currentXQ4InstallPath=/opt/xq";
  migrationFile(kVersionLine + fillerLines(kBlock - strlen(kVersionLine) - cut_path.size()) +
                cut_path + "4/V9.1\n");
  {
    const FailingCall reading(Call::fread, EIO, 2);
    EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));
    ASSERT_TRUE(reading.fired());
    EXPECT_EQ(findPath(), "/opt/xq4/V9.1");
  }
  EXPECT_EQ(find(), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALineOfTheGreatestLengthWhoseEndCannotBeRead) {
  const std::string line = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  migrationFile(line + "\n" + kVersionLine);
  {
    const CutRead reading(kLongestLine);
    EXPECT_EQ(find(), kNothing);
    ASSERT_TRUE(reading.fired());
  }
  EXPECT_EQ(find(), (Found{line.substr(line.find('=') + 1), "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, TakesAWholeLineBeforeAReadError) {
  const std::string before = fillerLines(kBlock - kBothLines.size()) + kBothLines;
  migrationFile(before + "currentXQ4Version=bad\n");
  const FailingCall reading(Call::fread, EIO, 2);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_TRUE(reading.fired());
}

TEST_F(GetXQ4PathAndVersion, TakesTheWholeLinesOfABlockThatAReadErrorCuts) {
  migrationFile(kBothLines + fillerLines(100) + kBothLines);
  {
    const CutRead reading(kBothLines.size() + 10);
    const FailingCall blocks(Call::fread, 0, kNever);
    EXPECT_EQ(find(), kBothFound);
    EXPECT_TRUE(reading.fired());
    EXPECT_EQ(blocks.calls(), 1);  // and reads no further
  }
  const std::string cut_version = "currentXQ4Version=9.1";
  migrationFile(kPathLine + cut_version + ".0.2\n");
  const CutRead reading(strlen(kPathLine) + cut_version.size());
  EXPECT_EQ(find(), kNothing);
  EXPECT_TRUE(reading.fired());
}

TEST_F(GetXQ4PathAndVersion, KeepsWhatItFoundBeforeAReadError) {
  migrationFile(kBothLines + fillerLines(3 * kBlock));
  for (int block = 2; block <= 4; ++block) {
    const FailingCall reading(Call::fread, EIO, block);

    EXPECT_EQ(find(), kBothFound);

    EXPECT_TRUE(reading.fired());
    EXPECT_EQ(reading.calls(), block);  // and reads no further
  }
}

TEST_F(GetXQ4PathAndVersion, DoesNotMindACloseThatFails) {
  migrationFile(kBothLines);
  const FailingCall closing(Call::fclose, EIO);
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(closing.calls(), 1);
  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.1.0.2\n"));
}

TEST_F(GetXQ4PathAndVersion, ClosesTheFileAfterAFailure) {
  migrationFile("currentXQ4Version=bad\n");
  const FailingCall closing(Call::fclose, 0, kNever);

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));
  EXPECT_EQ(closing.calls(), 1);

  expectComplaint(temp_.path("etc/xq4info"));
}

// ---- ... lines ----

TEST_F(GetXQ4PathAndVersion, OfAnEmptyFileIsNullAndSilent) {
  migrationFile("");
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
  EXPECT_EQ(findPath(), "(none)");
}

TEST_F(GetXQ4PathAndVersion, OfAFileWithoutTheKeysIsNullAndSilent) {
  migrationFile("\n\n# nothing\nother=/opt\n=\n");
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, TakesTheLinesInEitherOrder) {
  EXPECT_EQ(findIn(std::string(kVersionLine) + kPathLine), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesALastLineWithoutANewline) {
  EXPECT_EQ(findIn("currentXQ4Version=9.1.0.2\ncurrentXQ4InstallPath=/opt/xq4/V9.1/"), kBothFound);
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt/xq4/V9.1/\ncurrentXQ4Version=9.1.0.2"), kBothFound);
}

TEST_F(GetXQ4PathAndVersion, FindsAKeyWhereverItStandsInItsLine) {
  for (const char* const contents :
       {"# currentXQ4Version=9.1\n#currentXQ4InstallPath=/opt/xq4\n",
        "  currentXQ4Version=9.1\n\tcurrentXQ4InstallPath=/opt/xq4\n",
        "oldcurrentXQ4VersionOfThis=9.1\nmycurrentXQ4InstallPath2 is =/opt/xq4\n",
        "! currentXQ4Version currentXQ4Version=9.1\n\xff currentXQ4InstallPath:=/opt/xq4\n"}) {
    SCOPED_TRACE(contents);
    EXPECT_EQ(findIn(contents), (Found{"/opt/xq4", "9.1"}));
  }
}

TEST_F(GetXQ4PathAndVersion, FindsAKeyAsItIsSpeltOnly) {
  EXPECT_EQ(findIn("currentxq4installpath=/opt/xq4\nCURRENTXQ4VERSION=9.1\n"
                   "currentXQ4Install Path=/opt/xq4\ncurrentXQ4Versio=9.1\n"
                   "InstallPath=/opt/xq4\nVersion=9.1\n"),
            kNothing);
}

TEST_F(GetXQ4PathAndVersion, LooksAtTheFirstEqualsSignOnly) {
  EXPECT_EQ(findIn("a=currentXQ4InstallPath=/wrong\n= currentXQ4Version=8\n"), kNothing);
  EXPECT_EQ(findIn("a=currentXQ4InstallPath=/wrong\n= currentXQ4Version=8\n" + kBothLines),
            kBothFound);
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt/a=b=\ncurrentXQ4Version=9\n"),
            (Found{"/opt/a=b=", "9"}));
}

TEST_F(GetXQ4PathAndVersion, PassesOverAKeyWithoutAnEqualsSign) {
  EXPECT_EQ(findIn("currentXQ4InstallPath\ncurrentXQ4Version\ncurrentXQ4InstallPath /opt\n"),
            kNothing);
  EXPECT_EQ(findIn("currentXQ4InstallPath\n=/wrong\ncurrentXQ4Version 8\n" + kBothLines),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesTheFirstOfRepeatedKeys) {
  EXPECT_EQ(findIn(kBothLines + "currentXQ4InstallPath=/later\ncurrentXQ4Version=10\n"),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, NeverLooksAtALaterVersion) {
  migrationFile(kBothLines + "currentXQ4Version=bad\n");
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.1.0.2\n"));
}

TEST_F(GetXQ4PathAndVersion, TakesOneValueFromOneLine) {
  const std::string both = "currentXQ4InstallPath=/opt/xq4 currentXQ4Version=9.1\n";
  EXPECT_EQ(findIn(both), kNothing);
  EXPECT_EQ(findIn(both + kVersionLine), (Found{"/opt/xq4 currentXQ4Version=9.1", "9.1.0.2"}));
  // Either key stands before the sign.
  const std::string shared = "currentXQ4Version currentXQ4InstallPath=9.1\n";
  EXPECT_EQ(findIn(shared), kNothing);
  EXPECT_EQ(findIn(shared + shared), (Found{"9.1", "9.1"}));
}

TEST_F(GetXQ4PathAndVersion, TakesTheVersionOfALineWhosePathKeyComesTooLate) {
  EXPECT_EQ(findIn("currentXQ4Version=9.1 currentXQ4InstallPath=/opt/xq4\n"),
            (Found{"(none)", "(none)"}));

  const std::vector<CatalogueMessage> messages = takeCatalogueMessages();
  EXPECT_EQ(messages.size(), 1U);  // the rest of the line is part of the version
}

TEST_F(GetXQ4PathAndVersion, EndsALineAtANulByte) {
  using namespace std::string_literals;
  EXPECT_EQ(findIn("currentXQ4InstallPath=/opt\0/hidden\ncurrentXQ4Version=9.1\0.x\n"s),
            (Found{"/opt", "9.1"}));
  EXPECT_EQ(findIn("\0currentXQ4InstallPath=/opt\n\0\n#\0currentXQ4Version=9\n"s), kNothing);
  EXPECT_EQ(findIn("\0currentXQ4InstallPath=/opt\n\0\n#\0currentXQ4Version=9\n\0\n"s + kBothLines),
            kBothFound);
  EXPECT_EQ(findIn("currentXQ4Version=9\ncurrentXQ4InstallPath=/opt\0"s), (Found{"/opt", "9"}));
}

TEST_F(GetXQ4PathAndVersion, CountsTheCharactersBehindANulByteToo) {
  const std::string nuls(kLongestLine - strlen("currentXQ4InstallPath=/opt"), '\0');
  EXPECT_EQ(findIn(kVersionLine + ("currentXQ4InstallPath=/opt" + nuls) + "\n"),
            (Found{"/opt", "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + ("currentXQ4InstallPath=/opt" + nuls) + std::string(1, '\0') +
                   "\n" + kPathLine),
            (Found{"(none)", "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, TakesALineOfTheGreatestLengthWhole) {
  const std::string line = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  const std::string path = line.substr(line.find('=') + 1);
  EXPECT_EQ(path.size(), 1001U);

  EXPECT_EQ(findIn(line + "\n" + kVersionLine), (Found{path, "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + line + "\n"), (Found{path, "9.1.0.2"}));
  EXPECT_EQ(findIn(kVersionLine + line), (Found{path, "9.1.0.2"}));  // ends with the file
}

TEST_F(GetXQ4PathAndVersion, GoesOnBehindLinesOfTheGreatestLength) {
  const std::string line(kLongestLine, '#');
  EXPECT_EQ(findIn(line + "\n" + kPathLine + line + "\n" + line + "\n\n\n" + kVersionLine + line),
            kBothFound);
}

TEST_F(GetXQ4PathAndVersion, TakesNothingOfALongerLineNorOfWhatFollows) {
  for (const size_t length : {kLongestLine + 1, 2 * kLongestLine, 2 * kLongestLine + 1,
                              size_t{5000}, kBlock, 3 * kBlock + 1}) {
    for (const char* const end : {"", "\n"}) {
      SCOPED_TRACE(std::to_string(length) + end);
      const std::string path_line = filled("currentXQ4InstallPath=/opt/x", length) + end;
      const std::string version_line = filled("currentXQ4Version=1", length) + end;
      const std::string other_line = std::string(length, '#') + end;

      EXPECT_EQ(findIn(kVersionLine + path_line), (Found{"(none)", "9.1.0.2"}));
      EXPECT_EQ(findPathIn(kVersionLine + path_line), "(none)");
      EXPECT_EQ(findIn(kPathLine + version_line), kNothing);
      EXPECT_EQ(findIn(kPathLine + other_line + kVersionLine), kNothing);
      EXPECT_EQ(findPathIn(kPathLine + other_line), "/opt/xq4/V9.1");
      EXPECT_EQ(findIn(other_line + kBothLines), kNothing);
      EXPECT_EQ(findIn(kBothLines + other_line), kBothFound);
      EXPECT_EQ(findIn(kBothLines + other_line + kVersionLine), kBothFound);
    }
  }
}

TEST_F(GetXQ4PathAndVersion, TakesNoLaterPieceOfALongLineForALine) {
  const std::string piece(kLongestLine, '#');
  EXPECT_EQ(findIn(piece + kPathLine + kVersionLine), kNothing);
  EXPECT_EQ(findIn(piece + piece + kPathLine + kVersionLine), kNothing);
  EXPECT_EQ(findIn(kVersionLine + piece + " \n" + kPathLine), (Found{"(none)", "9.1.0.2"}));
}

TEST_F(GetXQ4PathAndVersion, CountsACarriageReturnAmongTheCharactersOfItsLine) {
  EXPECT_EQ(findIn(std::string(kLongestLine - 1, '#') + "\r\n" + kBothLines), kBothFound);
  EXPECT_EQ(findIn(std::string(kLongestLine, '#') + "\r\n" + kBothLines), kNothing);
}

TEST_F(GetXQ4PathAndVersion, ReadsLinesThatTwoBlocksShare) {
  const std::string longest = filled("currentXQ4InstallPath=/opt/x", kLongestLine);
  const std::string longest_path = longest.substr(longest.find('=') + 1);
  for (size_t before = kBlock - kBothLines.size() - 2; before <= kBlock + 2; ++before) {
    SCOPED_TRACE(before);
    EXPECT_EQ(findIn(fillerLines(before) + kBothLines), kBothFound);
  }
  for (const size_t before : {size_t{1}, kBlock - 2, kBlock - 1, kBlock, kBlock + 1}) {
    SCOPED_TRACE(before);
    EXPECT_EQ(findIn(fillerLines(before) + longest + "\n" + kVersionLine),
              (Found{longest_path, "9.1.0.2"}));
    EXPECT_EQ(findIn(fillerLines(before) + longest + "x\n" + kBothLines), kNothing);
  }
}

TEST_F(GetXQ4PathAndVersion, ReadsTheFileToItsEndThoughBothAreFound) {
  migrationFile(kBothLines + fillerLines(3 * kBlock));
  const FailingCall reading(Call::fread, 0, kNever);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_GE(reading.calls(), 4);
}

// ---- ... values ----

TEST_F(GetXQ4PathAndVersion, TrimsThePathsWhiteSpaceAndThenOneSeparator) {
  struct Case {
    const char* value;
    const char* path;
  };
  for (const auto& [value, path] : {Case{"/opt/xq4", "/opt/xq4"},
                                    {"/opt/xq4/", "/opt/xq4"},
                                    {"/opt/xq4//", "/opt/xq4/"},
                                    {"/opt/xq4\\", "/opt/xq4"},
                                    {"/opt/xq4\\\\", "/opt/xq4\\"},
                                    {"/opt/xq4/\\", "/opt/xq4/"},
                                    {"/opt/xq4  \r", "/opt/xq4"},
                                    {"/opt/xq4 \t\r \t", "/opt/xq4"},
                                    {"/opt/xq4/ ", "/opt/xq4"},
                                    {"/opt/xq4/\r", "/opt/xq4"},
                                    {"/opt/xq4 /", "/opt/xq4 "},
                                    {"/opt/xq4/ /", "/opt/xq4/ "},
                                    {"/opt/xq4\v", "/opt/xq4\v"},
                                    {"/opt/xq4\f", "/opt/xq4\f"},
                                    {"/opt/xq4\xa0", "/opt/xq4\xa0"},
                                    {" /opt/xq4", " /opt/xq4"},
                                    {"\t/opt xq4/x", "\t/opt xq4/x"},
                                    {"\"/opt/xq4\"", "\"/opt/xq4\""},
                                    {"C:\\xq4\\", "C:\\xq4"},
                                    {"/100%s%n", "/100%s%n"},
                                    {"", ""},
                                    {" \t\r", ""},
                                    {"/", ""},
                                    {"\\", ""},
                                    {" /", " "},
                                    {"//", "/"},
                                    {"=", "="}}) {
    SCOPED_TRACE(value);
    EXPECT_EQ(findIn("currentXQ4InstallPath=" + std::string(value) + "\ncurrentXQ4Version=9\n"),
              (Found{path, "9"}));
  }
}

TEST_F(GetXQ4PathAndVersion, TakesTheBlanksAroundTheEqualsSignIntoTheValue) {
  EXPECT_EQ(findPathIn("currentXQ4InstallPath = /opt/xq4\n"), " /opt/xq4");
}

TEST_F(GetXQ4PathAndVersion, RefusesAVersionThatIsNotOneToItsLastCharacter) {
  for (const char* const version : {"", " 9.1", "9.1 ", "9.1\t", "9.1\r", "9.1/", "9.1.", ".9",
                                    "9..1", "9.1.0.2.3", "9.1=2", "9.1%s%n", "x"}) {
    SCOPED_TRACE(version);
    const std::string file =
        migrationFile(kPathLine + ("currentXQ4Version=" + std::string(version)) + "\n");
    const LiveAllocations live;
    const Records records;

    EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

    expectComplaint(file);
    EXPECT_EQ(records.trail(),
              discovery(readable(), accessible(), versionCheck(version, false), shortname()));
    expectBlocks(live, 1);  // the path that it does not answer
  }
}

TEST_F(GetXQ4PathAndVersion, ReadsNoFurtherAfterAnInvalidVersion) {
  const std::string file = migrationFile("currentXQ4Version=9.x\n" + kBothLines);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  expectComplaint(file);
  EXPECT_THAT(records.texts(), ElementsAre("isVersionValid: version received is 9.x\n"));
}

TEST_F(GetXQ4PathAndVersion, ComplainsAboutTheVersionOfAFileWithCarriageReturns) {
  const std::string file =
      migrationFile("currentXQ4InstallPath=/opt/xq4/\r\ncurrentXQ4Version=9.1\r\n");

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));
  expectComplaint(file);

  EXPECT_EQ(findPath(), "/opt/xq4");
}

TEST_F(GetXQ4PathAndVersion, KeepsTheVersionAlthoughThereIsNoPath) {
  migrationFile(kVersionLine);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname()));
}

TEST_F(GetXQ4PathAndVersion, IsNullWithoutTheVersionThatIsWanted) {
  migrationFile(kPathLine);
  const Records records;

  EXPECT_EQ(find(), kNothing);

  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, NeedsThePathOnlyWhenNoVersionIsWanted) {
  migrationFile(kPathLine);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(findPath(), "/opt/xq4/V9.1");

  EXPECT_EQ(records.trail(), silence());
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, NeverLooksAtAVersionThatIsNotWanted) {
  migrationFile(std::string("currentXQ4Version=bad\n") + kPathLine);
  const Records records;

  EXPECT_EQ(findPath(), "/opt/xq4/V9.1");

  EXPECT_THAT(records.texts(), IsEmpty());
}

TEST_F(GetXQ4PathAndVersion, NeedsThePathWhenNoVersionIsWanted) {
  EXPECT_EQ(findPathIn(kVersionLine), "(none)");
}

// ---- ... memory ----

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForTheVersionReadsNoFurther) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kVersionLine + kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), silence());
  EXPECT_EQ(live.blocks(), 1);
}

// The path is copied last, whichever line comes first.
TEST_F(GetXQ4PathAndVersion, CopiesTheVersionBeforeThePath) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM);
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "(none)"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(), silence());
}

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForThePathSaysSoAndKeepsTheVersion) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM, 2);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true),
                      call("getShortname", 0, debug("getShortname: passed a null pointer.\n")),
                      error("getXQ4PathAndVersion: path4 is NULL\n")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetXQ4PathAndVersion, WithoutMemoryForTheAnswerSaysSoAndKeepsTheVersion) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall copy(Call::strdup, ENOMEM, 3);
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), (Found{"(none)", "9.1.0.2"}));

  ASSERT_TRUE(copy.fired());
  EXPECT_EQ(records.trail(),
            discovery(readable(), accessible(), versionCheck("9.1.0.2", true), shortname(),
                      error("getXQ4PathAndVersion: path4 is NULL\n")));
  EXPECT_EQ(live.blocks(), 0);
}

TEST_F(GetXQ4PathAndVersion, MakesNoOtherAllocations) {
  REQUIRE_OWN_MALLOC();
  migrationFile(kBothLines);
  const FailingCall allocation(Call::allocation, 0, kNever);
  const FailingCall print(Call::vra_asprintf, 0, kNever);

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(allocation.calls(), 3);
  EXPECT_EQ(print.calls(), 1);
}

TEST_F(GetXQ4PathAndVersion, KeepsThePathThatItDoesNotAnswer) {
  REQUIRE_OWN_MALLOC();
  // With a path, with the empty one of a file without a path, and with a file that cannot be read.
  for (const char* const contents : {kPathLine, kVersionLine, ""}) {
    SCOPED_TRACE(contents);
    migrationFile(contents);
    const LiveAllocations live;
    for (int calls = 1; calls <= 5; ++calls) {
      EXPECT_EQ(find().path, "(none)");
      EXPECT_EQ(live.blocks(), calls);
    }
  }
  const FailingCall opening(Call::fopen64, EIO);
  const LiveAllocations live;
  EXPECT_EQ(findPath(), "(none)");
  EXPECT_TRUE(opening.fired());
  EXPECT_EQ(live.blocks(), 1);
}

// ---- Ids ----

TEST_F(Layout, HasTheIdsOfItsModule) {
  const FailingCall query(Call::stat64, ENOENT, 1, kNever);  // whatever this machine has there
  const Records records(kEntryExit33);

  EXPECT_EQ(taken(getVRAInstallPath()), kDefaultRoot);
  EXPECT_EQ(taken(getVRAVarBasePath()), "/var/vraldap/V6.1");
  EXPECT_EQ(getVRABaseSchemaDirPath(nullptr), nullptr);
  EXPECT_EQ(getAdminLogsPath(3), nullptr);
  EXPECT_FALSE(isRDBMComponentInstalled());
  taken(getVRAInstallLibPath());
  taken(getVRAInstallSbinPath());
  taken(getVRAVrarunFilePath());
  EXPECT_EQ(getXQ4PathAndVersion(nullptr), nullptr);
  EXPECT_FALSE(isVersionValid(nullptr));

  // In the order in which they first appear.
  std::vector<uint64_t> ids;
  for (const Record& record : records.all()) {
    const bool is_ours = (record.id >> 16) == 0x3E08;
    if (is_ours && std::find(ids.begin(), ids.end(), record.id) == ids.end()) {
      ids.push_back(record.id);
    }
  }
  EXPECT_THAT(ids, ElementsAre(0x3E080100, 0x3E080200, 0x3E080300, 0x3E080400, 0x3E080500,
                               0x3E080600, 0x3E080700, 0x3E080800, 0x3E080900, 0x3E080A00));
}

}  // namespace
