#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "test_directoryutils.h"
#include "trails.h"
#include "world.h"

using testing::IsEmpty;

namespace {

// ---- Fixture ----

struct stat statusOf(const std::string& path) {
  struct stat status = {};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return status;
}

TRACED_AND_NOT(CreateDirectory);
TRACED_AND_NOT(DeleteDirectory);

// ---- createDirectory ----

TEST_P(CreateDirectory, RefusesANullPath) {
  EXPECT_FALSE(createDirectory(nullptr, nullptr, nullptr, 0755));
  EXPECT_EQ(trail(),
            traced(call("createDirectory", 0, debug("createDirectory: passed a null pointer.\n"))));
}

TEST_P(CreateDirectory, MakesADirectoryOfOnesOwn) {
  std::string path = temp_.path("new");

  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0750));

  EXPECT_EQ(trail(), traced(call("createDirectory", 1, missing(),
                                 call("setFileOwnersAndPermissions", 1, ownAccount()))));
  EXPECT_TRUE(std::filesystem::is_directory(path));
  EXPECT_EQ(modeOf(path), 0750U);
  EXPECT_EQ(statusOf(path).st_uid, getuid());
}

TEST_P(CreateDirectory, GivesExactlyTheModeWhateverTheUmask) {
  for (const unsigned int mode : {0U, 0700U, 0777U, 01777U, 02775U, 07777U}) {
    const Umask strict(077);
    std::string path = temp_.path("mode" + std::to_string(mode));
    EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, mode));
    EXPECT_EQ(modeOf(path), mode);
    EXPECT_EQ(rmdir(path.c_str()), 0);  // TempDir cannot remove what its user may not read
  }
}

TEST_P(CreateDirectory, HasAllBitsThatTheUmaskLeavesUntilItHasItsMode) {
  const Umask mask(005);
  std::string path = temp_.path("new");
  unsigned int before_owner = 0;
  unsigned int before_mode = 0;
  const BeforeCall owner(Call::chown, [&] { before_owner = modeOf(path); });
  const BeforeCall mode(Call::chmod, [&] { before_mode = modeOf(path); });

  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0705));

  ASSERT_TRUE(owner.fired() && mode.fired());
  EXPECT_EQ(before_owner, 0772U);
  EXPECT_EQ(before_mode, 0772U);
  EXPECT_EQ(modeOf(path), 0705U);
}

TEST_P(CreateDirectory, LeavesTheUmaskAlone) {
  std::string path = temp_.path("new");
  const FailingCall mask(Call::umask, 0, kNever);
  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0755));
  EXPECT_EQ(mask.calls(), 0);
}

TEST_P(CreateDirectory, GivesTheDirectoryToTheNamedUserAndGroup) {
  REQUIRE_ROOT("to give a directory away");
  std::string user = getpwuid(kNobody)->pw_name;
  const gid_t primary = getpwuid(kNobody)->pw_gid;
  std::string group = getgrgid(1)->gr_name;
  std::string path = temp_.path("new");
  std::string other = temp_.path("other");

  EXPECT_TRUE(createDirectory(path.data(), user.data(), group.data(), 0705));
  EXPECT_TRUE(createDirectory(other.data(), user.data(), nullptr, 0700));

  EXPECT_EQ(statusOf(path).st_uid, kNobody);
  EXPECT_EQ(statusOf(path).st_gid, 1U);
  EXPECT_EQ(modeOf(path), 0705U);
  EXPECT_EQ(statusOf(other).st_uid, kNobody);
  EXPECT_EQ(statusOf(other).st_gid, primary);
}

TEST_P(CreateDirectory, ToleratesThatAnOrdinaryUserMayNotGiveItAway) {
  openToAll(temp_.path());
  std::string path = temp_.path("new");
  char root[] = "root";
  asOrdinaryUser([&] {
    EXPECT_TRUE(createDirectory(path.data(), root, root, 0750));
    EXPECT_EQ(
        trail(),
        traced(call("createDirectory", 1, missing(),
                    call("setFileOwnersAndPermissions", 1, debug("vra_get_uid: name=root uid=0\n"),
                         debug("vra_get_usr_gid: name=root gid=0\n"),
                         debug("vra_getgrnam_gid: name=root gid=0\n"),
                         error("setFileOwnersAndPermissions: chown failed with errno=1.\n")))));
    EXPECT_EQ(statusOf(path).st_uid, getuid());
    EXPECT_EQ(modeOf(path), 0750U);
  });
}

TEST_P(CreateDirectory, ToleratesAFailedChangeOfOwner) {
  std::string path = temp_.path("new");
  const FailingCall owner(Call::chown, EIO);

  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0700));

  ASSERT_TRUE(owner.fired());
  EXPECT_EQ(trail(),
            traced(call("createDirectory", 1, missing(),
                        call("setFileOwnersAndPermissions", 1, ownAccount(),
                             error("setFileOwnersAndPermissions: chown failed with errno=5.\n")))));
  EXPECT_EQ(modeOf(path), 0700U);
}

TEST_P(CreateDirectory, OfAnExistingPathIsAFailureWithoutAWord) {
  const std::string directory = temp_.dir("directory");
  const std::string file = temp_.file("file", "text");
  makeLink(directory, temp_.path("link"));
  makeSocket(temp_.path("socket"));
  const FailingCall made(Call::mkdir, 0, kNever);

  for (const char* const name : {"directory", "file", "link", "socket"}) {
    SCOPED_TRACE(name);
    std::string path = temp_.path(name);
    EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0700));
    EXPECT_EQ(trail(), traced(call("createDirectory", 0, yes("doesFileExist"))));
  }

  EXPECT_EQ(made.calls(), 0);
  EXPECT_EQ(modeOf(directory), 0755U);
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(CreateDirectory, OfADanglingLinkFailsInTheSystemCall) {
  std::string path = temp_.path("link");
  makeLink("nowhere", path);

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));

  EXPECT_EQ(trail(), traced(call("createDirectory", 0, missing(),
                                 debug("createDirectory: mkdir() failed with rc='-1'"))));
  EXPECT_EQ(targetOf(path), "nowhere");
  EXPECT_FALSE(pathExists(temp_.path("nowhere")));
}

TEST_P(CreateDirectory, WhereParentsAreMissingMakesNone) {
  std::string path = temp_.path("missing/new");

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));

  EXPECT_EQ(trail(), traced(call("createDirectory", 0, missing(),
                                 debug("createDirectory: mkdir() failed with rc='-1'"))));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(CreateDirectory, BelowAFileFailsInTheSystemCall) {
  std::string path = temp_.file("file", "") + "/new";

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));

  EXPECT_EQ(trail(), traced(call("createDirectory", 0, query("doesFileExist", 0, ENOTDIR),
                                 query("canAccessFile", 1, ENOTDIR),
                                 debug("createDirectory: mkdir() failed with rc='-1'"))));
}

TEST_P(CreateDirectory, OfTheEmptyPathFailsInTheSystemCall) {
  char empty[] = "";
  EXPECT_FALSE(createDirectory(empty, nullptr, nullptr, 0755));
  EXPECT_EQ(trail(), traced(call("createDirectory", 0, missing(),
                                 debug("createDirectory: mkdir() failed with rc='-1'"))));
}

TEST_P(CreateDirectory, WherePermissionsHideThePathIsAFailureWithoutAWord) {
  const std::string closed = temp_.dir("closed");
  ASSERT_EQ(chmod(closed.c_str(), 0000), 0);
  std::string path = closed + "/new";
  asOrdinaryUser([&] {
    const FailingCall made(Call::mkdir, 0, kNever);
    EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));
    EXPECT_EQ(made.calls(), 0);
    EXPECT_EQ(trail(), traced(call("createDirectory", 0, query("doesFileExist", 0, EACCES),
                                   query("canAccessFile", 0, EACCES))));
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_THAT(namesIn(closed), IsEmpty());
}

TEST_P(CreateDirectory, InADirectoryThatMayNotBeWrittenFailsInTheSystemCall) {
  const std::string closed = temp_.dir("closed");
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  std::string path = closed + "/new";
  asOrdinaryUser([&] {
    EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));
    EXPECT_EQ(trail(), traced(call("createDirectory", 0, missing(),
                                   debug("createDirectory: mkdir() failed with rc='-1'"))));
  });
}

TEST_P(CreateDirectory, ReportsTheResultOfTheSystemCallNotItsError) {
  std::string path = temp_.path("new");
  const FailingCall made(Call::mkdir, ENOSPC);
  const FailingCall owner(Call::chown, 0, kNever);

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));

  ASSERT_TRUE(made.fired());
  EXPECT_EQ(owner.calls(), 0);
  EXPECT_EQ(trail(), traced(call("createDirectory", 0, missing(),
                                 debug("createDirectory: mkdir() failed with rc='-1'"))));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(CreateDirectory, ForAnUnknownUserOrGroupLeavesNothing) {
  char nobody_here[] = "no-such-name";
  std::string path = temp_.path("new");
  const Trail given_up =
      joined(debug("createDirectory: Cannot set the directory permissions\n"), removed());

  EXPECT_FALSE(createDirectory(path.data(), nobody_here, nullptr, 0755));
  EXPECT_EQ(
      trail(),
      traced(call(
          "createDirectory", 0, missing(),
          call("setFileOwnersAndPermissions", 0, debug("vra_get_uid: name=no-such-name uid=-99\n"),
               debug("setFileOwnersAndPermissions: user no-such-name does not exist.\n")),
          given_up)));
  EXPECT_FALSE(pathExists(path));

  char root[] = "root";
  EXPECT_FALSE(createDirectory(path.data(), root, nobody_here, 0755));
  EXPECT_EQ(
      trail(),
      traced(call("createDirectory", 0, missing(),
                  call("setFileOwnersAndPermissions", 0, debug("vra_get_uid: name=root uid=0\n"),
                       debug("vra_get_usr_gid: name=root gid=0\n"),
                       debug("vra_getgrnam_gid: name=no-such-name gid=-99\n"),
                       error("setFileOwnersAndPermissions: group no-such-name does not exist.\n")),
                  given_up)));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(CreateDirectory, WhoseModeCannotBeSetLeavesNothing) {
  std::string path = temp_.path("new");
  const FailingCall mode(Call::chmod, EIO);

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0755));

  ASSERT_TRUE(mode.fired());
  EXPECT_EQ(
      trail(),
      traced(call("createDirectory", 0, missing(),
                  call("setFileOwnersAndPermissions", 0, ownAccount(),
                       error("setFileOwnersAndPermissions: chmod failed with errno=5.\n")),
                  debug("createDirectory: Cannot set the directory permissions\n"), removed())));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(CreateDirectory, ThatCannotBeTakenBackStays) {
  std::string path = temp_.path("new");
  const FailingCall mode(Call::chmod, EIO);
  const FailingCall taken_back(Call::rmdir, EBUSY);

  EXPECT_FALSE(createDirectory(path.data(), nullptr, nullptr, 0700));

  ASSERT_TRUE(mode.fired() && taken_back.fired());
  EXPECT_EQ(trail(),
            traced(call("createDirectory", 0, missing(),
                        call("setFileOwnersAndPermissions", 0, ownAccount(),
                             error("setFileOwnersAndPermissions: chmod failed with errno=5.\n")),
                        debug("createDirectory: Cannot set the directory permissions\n"),
                        call("deleteDirectory", 0, isThere(),
                             debug("deleteDirectory: rmdir() failed with rc='-1'")))));
  EXPECT_EQ(modeOf(path), 0755U) << "as mkdir made it";
}

// ---- deleteDirectory ----

TEST_P(DeleteDirectory, RefusesANullPath) {
  EXPECT_FALSE(deleteDirectory(nullptr));
  EXPECT_EQ(trail(),
            traced(call("deleteDirectory", 0, debug("deleteDirectory: passed a null pointer.\n"))));
}

TEST_P(DeleteDirectory, RemovesAnEmptyDirectory) {
  const std::string path = temp_.dir("directory");
  EXPECT_TRUE(deleteDirectory(path.c_str()));
  EXPECT_EQ(trail(), traced(removed()));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(DeleteDirectory, KeepsOneThatIsNotEmpty) {
  const std::string path = temp_.dir("directory");
  const std::string file = temp_.file("directory/file", "text");

  EXPECT_FALSE(deleteDirectory(path.c_str()));

  EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, isThere(),
                                 debug("deleteDirectory: rmdir() failed with rc='-1'"))));
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirectory, OfAFileOrNothingIsAFailureWithoutAWord) {
  const std::string file = temp_.file("file", "text");
  const FailingCall taken_away(Call::rmdir, 0, kNever);

  EXPECT_FALSE(deleteDirectory(file.c_str()));
  EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, isFileThere())));
  EXPECT_FALSE(deleteDirectory(temp_.path("missing").c_str()));
  EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, query("doesFileExist", 0, ENOENT))));
  EXPECT_FALSE(deleteDirectory(""));
  EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, query("doesFileExist", 0, ENOENT))));

  EXPECT_EQ(taken_away.calls(), 0);
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirectory, OfALinkOrASocketFailsInTheSystemCall) {
  const std::string directory = temp_.dir("directory");
  makeLink(directory, temp_.path("link"));
  makeSocket(temp_.path("socket"));  // the type bits of a socket include that of a directory

  for (const char* const name : {"link", "socket"}) {
    SCOPED_TRACE(name);
    EXPECT_FALSE(deleteDirectory(temp_.path(name).c_str()));
    EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, isThere(),
                                   debug("deleteDirectory: rmdir() failed with rc='-1'"))));
    EXPECT_TRUE(pathExists(temp_.path(name)));
  }
  EXPECT_TRUE(pathExists(directory));
}

TEST_P(DeleteDirectory, WherePermissionsForbidItFails) {
  const std::string closed = temp_.dir("closed");
  const std::string path = temp_.dir("closed/directory");
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  asOrdinaryUser([&] {
    EXPECT_FALSE(deleteDirectory(path.c_str()));
    EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, isThere(),
                                   debug("deleteDirectory: rmdir() failed with rc='-1'"))));
  });
  ASSERT_EQ(chmod(closed.c_str(), 0000), 0);
  asOrdinaryUser([&] {
    EXPECT_FALSE(deleteDirectory(path.c_str()));
    EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, query("doesFileExist", 0, EACCES))));
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirectory, ReportsTheResultOfTheSystemCallNotItsError) {
  const std::string path = temp_.dir("directory");
  const FailingCall taken_away(Call::rmdir, EBUSY);

  EXPECT_FALSE(deleteDirectory(path.c_str()));

  ASSERT_TRUE(taken_away.fired());
  EXPECT_EQ(trail(), traced(call("deleteDirectory", 0, isThere(),
                                 debug("deleteDirectory: rmdir() failed with rc='-1'"))));
  EXPECT_TRUE(pathExists(path));
}

}  // namespace
