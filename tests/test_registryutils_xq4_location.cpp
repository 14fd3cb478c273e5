#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "owned.h"
#include "records.h"
#include "test_registryutils.h"
#include "trails.h"
#include "world.h"

using osutils::OwnedString;
using testing::IsEmpty;

namespace {

// ---- From the file to the result ----

// Expects both values, and the records of reading a file after those `before`.
void expectBothFound(Found (*find)(), const Trail& before) {
  const LiveAllocations live;
  const Records records;

  EXPECT_EQ(find(), kBothFound);

  EXPECT_EQ(records.trail(), discovery(before, readable(), accessible(),
                                       versionCheck("9.1.0.2", true), shortname()));
  expectBlocks(live, 0);
}

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheMigrationFile) {
  migrationFile(kBothLines);
  expectBothFound(find, {});
}

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheInstancesFile) {
  instanceFile(kBothLines);
  expectBothFound(find, {});
}

TEST_F(GetXQ4PathAndVersion, ReadsBothFromTheInstallationsFile) {
  installationFile(kBothLines);
  expectBothFound(find, installPath());
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

// ---- Choice of the file ----

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

TEST_F(GetXQ4PathAndVersion, OfEmptyNamesIsNotAnError) {
  const FailingCall query(Call::stat64, ENOENT, 1,
                          3);  // independent of what this machine has there
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

// Runs a test in each situation.
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

}  // namespace
