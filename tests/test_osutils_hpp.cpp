// Every function of osutils.hpp, beside the function of osutils.h that it calls.
#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <net/if.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <new>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "faults.h"
#include "osutils.hpp"
#include "records.h"
#include "test_iputils.h"
#include "test_usergrouputils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::Optional;
using VRAOSUtils::EtcInittab;

namespace {

// How many allocations succeed before one throws; -1 for all.
int allocations_left = -1;

// From construction on, the `nth` allocation of operator new throws.
class NoMemory {
 public:
  explicit NoMemory(int nth) { allocations_left = nth - 1; }
  ~NoMemory() { allocations_left = -1; }
  NoMemory(const NoMemory&) = delete;
  NoMemory& operator=(const NoMemory&) = delete;
};

}  // namespace

#ifndef __clang_analyzer__  // which would take the blocks of gmock for leaks
void* operator new(size_t size) {
  if (allocations_left == 0) throw std::bad_alloc();
  if (allocations_left > 0) --allocations_left;
  if (void* const block = malloc(size == 0 ? 1 : size)) return block;
  throw std::bad_alloc();
}
void operator delete(void* block) noexcept { free(block); }
void operator delete(void* block, size_t) noexcept { free(block); }
#endif

namespace {

using Text = std::optional<std::string>;

constexpr char kHome[] = "VRA_LDAP_HOME";
constexpr char kLibrary[] = "libresolv.so.2";  // installed with the C library

void expectBlocks(const LiveAllocations& live, int blocks) {
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), blocks);
  }
}

// Expects the text, the record of one call of the function, and that nothing stays allocated but
// what the function itself leaks.
void expectTaken(const char* function, const std::function<Text()>& call, const std::string& text,
                 int leaks = 0) {
  SCOPED_TRACE(function);
  const LiveAllocations live;
  const Records records;

  EXPECT_THAT(call(), Optional(text));

  const std::vector<std::string> trail = records.trail();
  int entries = 0;
  for (const std::string& record : trail) entries += record == "> " + std::string(function) ? 1 : 0;
  EXPECT_EQ(entries, 1);
  expectBlocks(live, leaks);
}

// ---- Result codes ----

TEST(ResultCategory, HasANameAndTheNamesOfAllCodes) {
  EXPECT_STREQ(osutils::resultCategory().name(), "osutils");
  const struct {
    int code;
    const char* name;
  } kNames[] = {{OSUTILS_SUCCESS, "success"},
                {OSUTILS_OPERATIONS_ERROR, "operations error"},
                {OSUTILS_CONSTRAINT_VIOLATION, "constraint violation"},
                {OSUTILS_NO_SUCH_OBJECT, "no such object"},
                {OSUTILS_INVALID_CREDENTIALS, "invalid credentials"},
                {OSUTILS_INSUFFICIENT_ACCESS, "insufficient access"},
                {OSUTILS_UNAVAILABLE, "unavailable"},
                {OSUTILS_UNWILLING_TO_PERFORM, "unwilling to perform"},
                {OSUTILS_ALREADY_EXISTS, "already exists"},
                {OSUTILS_OTHER, "other"},
                {OSUTILS_PARAM_ERROR, "parameter error"},
                {OSUTILS_NO_MEMORY, "no memory"},
                {-1, "unknown result"},
                {2, "unknown result"}};
  for (const auto& each : kNames) EXPECT_EQ(osutils::errorCode(each.code).message(), each.name);
}

TEST(ErrorCode, IsTrueForAFailureAndEqualForTheSameCode) {
  EXPECT_FALSE(osutils::errorCode(checkFilePerms("/etc/passwd")));
  const std::error_code missing = osutils::errorCode(checkFilePerms("/nonexistent"));
  EXPECT_TRUE(missing);
  EXPECT_EQ(missing.value(), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_EQ(missing, osutils::errorCode(OSUTILS_NO_SUCH_OBJECT));
  EXPECT_NE(missing, osutils::errorCode(OSUTILS_OTHER));
  EXPECT_NE(missing, std::error_code(OSUTILS_NO_SUCH_OBJECT, std::generic_category()));
}

// ---- Owners ----

TEST(Take, CopiesAStringAndFreesIt) {
  TempDir temp;
  const std::string file = temp.file("inittab", "vra0:2:once:/bin/true\n");
  const char* const previous = EtcInittab::ETC_INITTAB_FILE;
  EtcInittab::ETC_INITTAB_FILE = file.c_str();
  {
    EtcInittab inittab;
    EXPECT_FALSE(osutils::errorCode(inittab.readInittab()));
    const LiveAllocations live;
    EXPECT_THAT(osutils::take(inittab.findAvaliableID()), Optional(std::string("vra1")));
    EXPECT_THAT(osutils::take(inittab.getEntryInitIDWithCommand("true")),
                Optional(std::string("vra0")));
    EXPECT_EQ(osutils::take(inittab.getEntryInitIDWithCommand("false")), std::nullopt);
    expectBlocks(live, 0);
  }
  EtcInittab::ETC_INITTAB_FILE = previous;
}

TEST(Take, WithoutMemoryFreesTheStringAndThrows) {
  const std::string name(100, 'n');
  const LiveAllocations live;
  const NoMemory no_memory(1);
  EXPECT_THROW((void)osutils::take(::getShortname(name.c_str())), std::bad_alloc);
  expectBlocks(live, 0);
}

TEST(TakeList, WithoutMemoryFreesTheWholeListAndThrows) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const std::string long_name(100, 'm');
    writeFile("/etc/group", "long:x:2001:" + long_name + "," + long_name + "\n");
    int failures = 0;
    for (bool taken = false; !taken; ++failures) {
      ASSERT_LT(failures, 10);
      const LiveAllocations live;
      char** const list = ::vra_getgrnam_mem("long");
      try {
        const NoMemory no_memory(failures + 1);
        (void)osutils::takeList(list);
        taken = true;
      } catch (const std::bad_alloc&) {
      }
      expectBlocks(live, 0);
    }
    EXPECT_GE(failures, 3);  // the array, and each of the two texts
  });
}

TEST(TakeList, OfNullIsNothing) { EXPECT_EQ(osutils::takeList(nullptr), std::nullopt); }

TEST(Owned, FreesAStringOrAListWithItsEntries) {
  const LiveAllocations live;
  {
    const osutils::Owned<char> text(::getTempDir());
    EXPECT_STREQ(text.get(), "/tmp");
    const osutils::Owned<char*> list(::vra_getgrnam_mem("root"));
    EXPECT_TRUE(list);
  }
  expectBlocks(live, 0);
}

TEST(Free, AcceptsNull) {
  const osutils::Free release;
  release(static_cast<char*>(nullptr));
  release(static_cast<char**>(nullptr));
}

// ---- Environment and installation layout ----

// Each test starts without VRA_LDAP_HOME.
class Hpp : public testing::Test {
 protected:
  Hpp() {
    if (const char* const value = getenv(kHome)) home_ = value;
    unsetenv(kHome);
  }
  ~Hpp() override {
    if (home_) {
      setenv(kHome, home_->c_str(), 1);
    } else {
      unsetenv(kHome);
    }
  }

 private:
  std::optional<std::string> home_;
};

TEST_F(Hpp, PathsAreThoseOfTheInstallation) {
  setenv(kHome, "/home of it", 1);
  expectTaken(
      "getEnvVar", [] { return osutils::getEnvVar(kHome); }, "/home of it");
  expectTaken("getVRAInstallPath", osutils::getVRAInstallPath, "/home of it");
  expectTaken("getVRAVarBasePath", osutils::getVRAVarBasePath, "/var/vraldap/V6.1");
  expectTaken(
      "getVRABaseSchemaDirPath", [] { return osutils::getVRABaseSchemaDirPath("6.1"); },
      "/home of it/etc/SchemaV6.1", 1);
  expectTaken(
      "getAdminLogsPath", [] { return osutils::getAdminLogsPath(ADMIN_LOG_ADM); },
      taken(::getAdminLogsPath(ADMIN_LOG_ADM)));
  expectTaken("getVRAInstallLibPath", osutils::getVRAInstallLibPath, "/home of it/lib64");
  expectTaken("getVRAInstallSbinPath", osutils::getVRAInstallSbinPath, "/home of it/sbin");
  expectTaken("getVRAVrarunFilePath", osutils::getVRAVrarunFilePath, "/home of it/sbin/64/vrarun");
}

TEST_F(Hpp, NothingStandsForNull) {
  EXPECT_EQ(osutils::getEnvVar(kHome), std::nullopt);
  EXPECT_EQ(osutils::getAdminLogsPath(99), std::nullopt);
  EXPECT_EQ(osutils::formatDn(""), std::nullopt);
}

TEST_F(Hpp, AnArgumentEndsAtItsFirstNul) {
  setenv(kHome, "/here", 1);
  EXPECT_THAT(osutils::getEnvVar(kHome + std::string("\0_NOT", 5)), Optional(std::string("/here")));
}

TEST_F(Hpp, NothingIsThrownIfTheCFunctionHasNoMemory) {
  REQUIRE_OWN_MALLOC();
  const FailingCall allocation(Call::allocation, ENOMEM);
  EXPECT_EQ(osutils::getShortname("name"), std::nullopt);
  EXPECT_TRUE(allocation.fired());
}

// ---- Database discovery ----

class HppDatabase : public testing::Test {
 protected:
  HppDatabase() {
    (void)temp_.dir("etc");
    g_isCallerVraImigr = 1;
    g_migBackDir = temp_.path().c_str();
  }
  ~HppDatabase() override {
    g_isCallerVraImigr = 0;
    g_migBackDir = nullptr;
  }

  void properties(const char* lines) { (void)temp_.file("etc/xq4info", lines); }

 private:
  TempDir temp_;
};

TEST_F(HppDatabase, PathAndVersionAreFound) {
  properties("currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=9.1\n");
  const LiveAllocations live;
  std::string version = "before";
  EXPECT_THAT(osutils::getXQ4PathAndVersion(&version), Optional(std::string("/opt/db")));
  EXPECT_EQ(version, "9.1");
  expectBlocks(live, 0);
}

TEST_F(HppDatabase, ThePathIsFoundWithoutAVersionIfItIsNotAskedFor) {
  properties("currentXQ4InstallPath=/opt/db\n");
  std::string version = "before";
  EXPECT_THAT(osutils::getXQ4PathAndVersion(), Optional(std::string("/opt/db")));
  EXPECT_EQ(osutils::getXQ4PathAndVersion(&version), std::nullopt);
  EXPECT_EQ(version, "before");
}

TEST_F(HppDatabase, AVersionWithoutAPathIsFreedAndNotStored) {
  properties("currentXQ4Version=9.1\n");
  std::string version = "before";
  EXPECT_EQ(osutils::getXQ4PathAndVersion(&version), std::nullopt);
  EXPECT_EQ(version, "before");
}

// ---- Files, directories and time ----

TEST_F(Hpp, AFileIsRead) {
  TempDir temp;
  const LiveAllocations live;
  {
    const osutils::Owned<char> contents = osutils::readFile(temp.file("some", "text"));
    ASSERT_TRUE(contents);
    EXPECT_EQ(std::string(contents.get(), 4), "text");
    EXPECT_TRUE(osutils::readFile(temp.file("empty", "")));
    EXPECT_FALSE(osutils::readFile(temp.path("missing")));
    EXPECT_FALSE(osutils::readFile(temp.path()));
  }
  expectBlocks(live, 0);
}

TEST_F(Hpp, NamesOfFilesAndDirectories) {
  char directory[PATH_MAX];
  ASSERT_NE(getcwd(directory, sizeof directory), nullptr);
  expectTaken(
      "getFileNameFromPath", [] { return osutils::getFileNameFromPath("/some/name"); }, "name");
  expectTaken("getTempDir", osutils::getTempDir, "/tmp");
  expectTaken("getSystemDrive", osutils::getSystemDrive, "/");
  expectTaken(
      "getShortname", [] { return osutils::getShortname("a name"); }, "a name");
  expectTaken("getCurrentWorkingDirectory", osutils::getCurrentWorkingDirectory, directory);
}

TEST_F(Hpp, OwnersOfAFile) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    TempDir temp;
    const std::string path = temp.file("file", "");
    ASSERT_EQ(chown(path.c_str(), kAnn, kStaff), 0);
    ASSERT_EQ(chmod(path.c_str(), 0640), 0);
    const LiveAllocations live;

    const auto owners = osutils::getFileOwnersAndPermissions(path);

    ASSERT_TRUE(owners);
    EXPECT_THAT(owners->owner, Optional(std::string("ann")));
    EXPECT_THAT(owners->group, Optional(std::string("staff")));
    EXPECT_EQ(owners->mode, S_IFREG | 0640U);
    expectBlocks(live, 0);
    EXPECT_EQ(osutils::getFileOwnersAndPermissions(temp.path("missing")), std::nullopt);
  });
}

TEST_F(Hpp, AnOwnerForWhichMemoryRanOutIsNothing) {
  REQUIRE_OWN_MALLOC();
  const FailingCall strdup(Call::strdup, ENOMEM, 1, 2);
  const auto owners = osutils::getFileOwnersAndPermissions("/");
  EXPECT_TRUE(strdup.fired());
  ASSERT_TRUE(owners);
  EXPECT_EQ(owners->owner, std::nullopt);
  EXPECT_EQ(owners->group, std::nullopt);
}

TEST_F(Hpp, OwnersWithoutMemoryForTheCopyAreFreed) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const std::string long_name(100, 'g');
    writeFile("/etc/passwd", "ann:x:0:0:Ann:/:/bin/sh\n");
    writeFile("/etc/group", long_name + ":x:0:\n");
    const LiveAllocations live;
    const std::string root = "/";
    const NoMemory no_memory(1);
    EXPECT_THROW((void)osutils::getFileOwnersAndPermissions(root), std::bad_alloc);
    expectBlocks(live, 0);
  });
}

TEST_F(Hpp, TheTimeHasTwoForms) {
  const FakeClock clock(1146481845, 123000);
  for (const int flag : {0, 1}) {
    expectTaken(
        "getCurrentTimeStamp", [&] { return osutils::getCurrentTimeStamp(flag); },
        taken(::getCurrentTimeStamp(flag)));
  }
  EXPECT_NE(osutils::getCurrentTimeStamp(0), osutils::getCurrentTimeStamp(1));
}

// ---- Accounts ----

TEST_F(Hpp, AccountsAreLookedUp) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const LiveAllocations live;
    EXPECT_THAT(osutils::vra_getpwnam_homedir("ann"), Optional(std::string("/home/ann")));
    EXPECT_THAT(osutils::vra_getgrnam_mem("staff"), Optional(ElementsAre("zed", "ann", "bob")));
    EXPECT_THAT(osutils::vra_getgrnam_mem("music"), Optional(IsEmpty()));
    EXPECT_THAT(osutils::vra_get_usr_name("ann"), Optional(std::string("ann")));
    EXPECT_THAT(osutils::vra_get_usr_name(), Optional(std::string("root")));
    EXPECT_THAT(osutils::vra_getgrgid_name(kStaff), Optional(std::string("staff")));
    EXPECT_THAT(osutils::getUsersPrimaryGroup("ann"), Optional(std::string("staff")));
    EXPECT_THAT(osutils::getUsersPrimaryGroup(), Optional(std::string("root")));
    EXPECT_THAT(osutils::getUserHomeDir("ann"), Optional(std::string("/home/ann")));
    expectBlocks(live, 0);
  });
}

TEST_F(Hpp, UnknownAccountsAreNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    EXPECT_EQ(osutils::vra_getpwnam_homedir("none"), std::nullopt);
    EXPECT_EQ(osutils::vra_getgrnam_mem("none"), std::nullopt);
    EXPECT_EQ(osutils::vra_get_usr_name("none"), std::nullopt);
    EXPECT_EQ(osutils::vra_getgrgid_name(2999), std::nullopt);
    EXPECT_EQ(osutils::getUsersPrimaryGroup("stray"), std::nullopt);
    EXPECT_EQ(osutils::getUserHomeDir("none"), std::nullopt);
  });
}

// ---- Shared libraries ----

TEST_F(Hpp, ALibraryIsUnloadedAtTheEndOfItsScope) {
  const auto isLoaded = [] {
    void* const handle = dlopen(kLibrary, RTLD_LAZY | RTLD_NOLOAD);
    if (handle != nullptr) dlclose(handle);
    return handle != nullptr;
  };
  if (isLoaded()) GTEST_SKIP() << kLibrary << " is part of this program";
  const LiveAllocations live;
  {
    const osutils::SharedLib lib = osutils::loadSharedLib(kLibrary);
    ASSERT_TRUE(lib);
    EXPECT_TRUE(isLoaded());
    EXPECT_NE(getSymAddress(lib.get(), "ns_sprintrr"), nullptr);
  }
  EXPECT_FALSE(isLoaded());
  expectBlocks(live, 0);
}

TEST_F(Hpp, ALibraryIsLoadedWithTheMode) {
  const Records records;
  EXPECT_FALSE(osutils::loadSharedLib("/nonexistent/libnone.so", RTLD_LAZY));
  const std::vector<std::string> texts = records.texts();
  ASSERT_FALSE(texts.empty());
  EXPECT_THAT(texts.back(),
              testing::HasSubstr("(/nonexistent/libnone.so," + std::to_string(RTLD_LAZY) + ")"));
}

TEST_F(Hpp, NoFileNameIsTheProgramItself) {
  const osutils::SharedLib program = osutils::loadSharedLib(std::nullopt);
  ASSERT_TRUE(program);
  EXPECT_NE(getSymAddress(program.get(), "PrintDebugVa"), nullptr);
}

// ---- Host addresses ----

TEST_F(Hpp, AddressesAreThoseOfTheNames) {
  REQUIRE_NETWORK();
  withNetwork(hostsOf({"10.1.2.3", "10.1.2.4"}), [] {
    const LiveAllocations live;
    std::vector<std::string> list = {"before"};
    EXPECT_EQ(osutils::getAllIPAddresses(list), 0);
    EXPECT_THAT(list, testing::UnorderedElementsAre("10.1.2.3", "10.1.2.4"));
    list = {"before"};
    EXPECT_EQ(osutils::getLocalHostIPAddress(list), 0);
    EXPECT_THAT(list, testing::UnorderedElementsAre("10.1.2.3", "10.1.2.4"));
    expectBlocks(live, 0);
  });
}

TEST_F(Hpp, AddressesOfInterfaces) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const std::vector<std::string> added = addAliases(2);
    const LiveAllocations live;
    std::vector<std::string> list = {"before"};
    ifconf scratch = {};
    EXPECT_EQ(osutils::getAllIPAddresses_Linux(list, &scratch), 0);
    EXPECT_EQ(list, added);
    expectBlocks(live, 0);
  });
}

TEST_F(Hpp, AddressesAfterAFailureAreNone) {
  const NoNameLookUp offline;
  std::vector<std::string> list = {"before"};
  for (const auto get : {osutils::getAllIPAddresses, osutils::getLocalHostIPAddress}) {
    list = {"before"};
    const FailingCall resolver(Call::getaddrinfo, EAI_AGAIN);
    EXPECT_EQ(get(list), EAI_AGAIN);
    EXPECT_THAT(list, IsEmpty());
  }
  list = {"before"};
  ifconf scratch = {};
  const FailingCall interfaces(Call::ioctl, EPERM);
  EXPECT_EQ(osutils::getAllIPAddresses_Linux(list, &scratch), -1);
  EXPECT_THAT(list, IsEmpty());
}

TEST_F(Hpp, AnAddressIsSoughtInAList) {
  const std::vector<std::string> list = {"10.1.2.3", "2001:db8::AB"};
  EXPECT_TRUE(osutils::isValidIPAddressInList("10.1.2.3", list));
  EXPECT_TRUE(osutils::isValidIPAddressInList("2001:DB8::ab", list));
  EXPECT_FALSE(osutils::isValidIPAddressInList("10.1.2", list));
  EXPECT_FALSE(osutils::isValidIPAddressInList("", list));
  EXPECT_FALSE(osutils::isValidIPAddressInList("10.1.2.3", {}));
}

// ---- Distinguished names ----

TEST_F(Hpp, ANameIsFormattedInACopy) {
  const std::string dn = "cn = a ; o=x";
  expectTaken(
      "formatDn", [&] { return osutils::formatDn(dn); }, "CN=A,O=X");
  EXPECT_EQ(dn, "cn = a ; o=x");
}

}  // namespace
