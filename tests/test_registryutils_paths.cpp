#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <type_traits>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "owned.h"
#include "records.h"
#include "test_registryutils.h"
#include "trails.h"
#include "world.h"

using osutils::OwnedString;
using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr char kDefaultRoot[] = "/opt/orx/ldap/V6.1";

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
  // Independent of what this machine has there.
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

// ---- Directories of libraries and programs ----

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

// ---- All paths ----

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

// ---- Ids ----

TEST_F(Layout, HasTheIdsOfItsModule) {
  const FailingCall query(Call::stat64, ENOENT, 1,
                          kNever);  // independent of what this machine has there
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
