#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "faults.h"
#include "osutils.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

TRACED_AND_NOT(CreateFile);
TRACED_AND_NOT(DeleteFile);

// ---- createFile ----

TEST_P(CreateFile, RefusesANullPath) {
  EXPECT_FALSE(createFile(nullptr, nullptr, nullptr, 0640));
  EXPECT_EQ(trail(),
            traced(call("createFile", 0, debugLine("createFile: passed a null pointer."))));
  EXPECT_EQ(currentUmask(), 022U);
}

TEST_P(CreateFile, MakesAnEmptyFileOfTheOwnAccount) {
  std::string path = temp_.path("new");
  const int open_before = openDescriptors();

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(trail(), traced(createdForOwnAccount()));
  const struct stat64 status = statusOf(path);
  EXPECT_EQ(status.st_mode, S_IFREG | 0640U);
  EXPECT_EQ(status.st_uid, getuid());
  EXPECT_EQ(status.st_gid, ownGroup());
  EXPECT_EQ(status.st_size, 0);
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CreateFile, SetsExactlyTheModeWhateverTheMask) {
  std::string path = temp_.path("new");
  for (const mode_t mode : {0U, 0200U, 0644U, 0666U, 0777U, 04755U, 01777U}) {
    SCOPED_TRACE(mode);
    EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, mode));
    EXPECT_EQ(modeOf(path), mode);
  }
}

TEST_P(CreateFile, OpensWithMode0640LessItsMask) {
  std::string path = temp_.path("new");
  unsigned int mode = 0;
  const BeforeCall owner(Call::fchown, [&] { mode = modeOf(path); });

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0777));

  ASSERT_TRUE(owner.fired());
  EXPECT_EQ(mode, 0640U);
}

TEST_P(CreateFile, GivesTheFileToTheNamedUserAndGroup) {
  REQUIRE_ROOT("to give a file away");
  std::string user = getpwuid(kNobody)->pw_name;
  const gid_t primary = getpwuid(kNobody)->pw_gid;
  std::string group = getgrgid(1)->gr_name;
  std::string path = temp_.path("new");

  EXPECT_TRUE(createFile(path.data(), user.data(), group.data(), 0604));
  EXPECT_EQ(statusOf(path).st_uid, kNobody);
  EXPECT_EQ(statusOf(path).st_gid, 1U);
  EXPECT_EQ(modeOf(path), 0604U);

  EXPECT_TRUE(createFile(path.data(), user.data(), nullptr, 0600));  // the primary group
  EXPECT_EQ(statusOf(path).st_uid, kNobody);
  EXPECT_EQ(statusOf(path).st_gid, primary);
}

TEST_P(CreateFile, LeavesItsMaskInTheProcess) {
  std::string path = temp_.path("new");
  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0640));
  EXPECT_EQ(currentUmask(), 026U);
}

TEST_P(CreateFile, ReplacesAnExistingFile) {
  std::string path = temp_.file("file", "old contents");
  makeHardLink(path, temp_.path("old"));  // keeps the inode number from being reused

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0606));

  EXPECT_EQ(trail(),
            traced(call("createFile", 1, yes("doesFileExist"), kDeleted, givenToOwnAccount())));
  EXPECT_NE(statusOf(path).st_ino, statusOf(temp_.path("old")).st_ino);
  EXPECT_EQ(contentsOf(path), "");
  EXPECT_EQ(modeOf(path), 0606U);
  EXPECT_EQ(contentsOf(temp_.path("old")), "old contents");
}

TEST_P(CreateFile, ReplacesALinkAndNotItsTarget) {
  const std::string target = temp_.file("target", "kept");
  std::string link = temp_.path("link");
  makeLink(target, link);

  EXPECT_TRUE(createFile(link.data(), nullptr, nullptr, 0640));

  EXPECT_TRUE(S_ISREG(statusOf(link).st_mode));
  EXPECT_EQ(contentsOf(target), "kept");
}

TEST_P(CreateFile, MakesTheTargetOfADanglingLink) {
  std::string link = temp_.path("link");
  makeLink(temp_.path("target"), link);

  EXPECT_TRUE(createFile(link.data(), nullptr, nullptr, 0640));

  EXPECT_TRUE(S_ISLNK(statusOf(link).st_mode));
  EXPECT_EQ(modeOf(temp_.path("target")), 0640U);
}

TEST_P(CreateFile, UsesTheOldFileWhenItCannotBeRemoved) {
  std::string path = temp_.file("file", "old contents");
  const ino_t inode = statusOf(path).st_ino;
  const FailingCall removal(Call::remove, EBUSY);

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0604));

  ASSERT_TRUE(removal.fired());
  EXPECT_EQ(trail(), traced(call("createFile", 1, yes("doesFileExist"),
                                 call("deleteFile", 0, no("isDirectory"),
                                      debugLine("deleteFile: remove - errno =16")),
                                 givenToOwnAccount())));
  EXPECT_EQ(statusOf(path).st_ino, inode);
  EXPECT_EQ(contentsOf(path), "old contents");
  EXPECT_EQ(modeOf(path), 0604U);
}

TEST_P(CreateFile, FailsOnADirectoryAndLeavesIt) {
  std::string directory = temp_.dir("directory");

  EXPECT_FALSE(createFile(directory.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(trail(), traced(call("createFile", 0, yes("doesFileExist"),
                                 call("deleteFile", 0, yes("isDirectory")),
                                 errorLine("createFile: open - errno =21"))));
  EXPECT_EQ(modeOf(directory), 0755U);
  EXPECT_EQ(currentUmask(), 026U);
}

TEST_P(CreateFile, FailsBelowAHiddenDirectoryBeforeTheMask) {
  const std::string closed = temp_.dir("closed");
  std::string inside = closed + "/new";
  const Permissions unsearchable(closed, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              const FailingCall opened(Call::open64, EIO);
              EXPECT_FALSE(createFile(inside.data(), nullptr, nullptr, 0640));
              EXPECT_EQ(trail(), traced(call("createFile", 0, hidden())));
              EXPECT_EQ(opened.calls(), 0);
              EXPECT_EQ(currentUmask(), 022U);
              return 0;
            }),
            0);
}

TEST_P(CreateFile, FailsInADirectoryThatMayNotBeWritten) {
  std::string path = temp_.path("new");
  const Permissions fixed(temp_.path(), 0555);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));
              EXPECT_EQ(trail(), traced(call("createFile", 0, missing(),
                                             errorLine("createFile: open - errno =13"))));
              EXPECT_EQ(currentUmask(), 026U);
              return 0;
            }),
            0);
}

TEST_P(CreateFile, FailsForPathsThatNoFileCanHave) {
  const std::pair<std::string, int> cases[] = {
      {"", ENOENT},
      {temp_.path("none/new"), ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (auto [path, reason] : cases) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));
    EXPECT_EQ(trail(),
              traced(call("createFile", 0, query("doesFileExist", 0, reason),
                          query("canAccessFile", 1, reason),
                          errorLine("createFile: open - errno =" + std::to_string(reason)))));
  }
}

TEST_P(CreateFile, HasRemovedTheOldFileWhenTheOpenFails) {
  std::string path = temp_.file("file", "old contents");
  const FailingCall opened(Call::open64, ENFILE);

  EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(), traced(call("createFile", 0, yes("doesFileExist"), kDeleted,
                                 errorLine("createFile: open - errno =23"))));
  EXPECT_FALSE(pathExists(path));
  EXPECT_EQ(currentUmask(), 026U);
}

TEST_P(CreateFile, LeavesNoFileOfAnUnknownUser) {
  std::string path = temp_.file("file", "old contents");
  std::string user = "no-such-user";
  const int open_before = openDescriptors();

  EXPECT_FALSE(createFile(path.data(), user.data(), nullptr, 0640));

  EXPECT_EQ(
      trail(),
      traced(call("createFile", 0, yes("doesFileExist"), kDeleted,
                  call("setFileOwnersAndPermissions", 0,
                       debugLine("vra_get_uid: name=no-such-user uid=-99"),
                       debugLine("setFileOwnersAndPermissions: user no-such-user does not exist.")),
                  errorLine("createFile: Cannot set the file permissions"), kDeleted)));
  EXPECT_FALSE(pathExists(path));
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CreateFile, LeavesNoFileOfAnUnknownGroup) {
  std::string path = temp_.path("new");
  for (std::string group : {std::string("no-such-group"), std::string()}) {
    SCOPED_TRACE(group);
    EXPECT_FALSE(createFile(path.data(), nullptr, group.data(), 0640));
    const std::string gid = std::to_string(ownGroup());
    EXPECT_EQ(trail(),
              traced(call("createFile", 0, missing(),
                          call("setFileOwnersAndPermissions", 0,
                               debugLine("vra_get_uid: name=NULL uid=" + std::to_string(getuid())),
                               debugLine("vra_get_usr_gid: name=NULL gid=" + gid),
                               debugLine("vra_getgrnam_gid: name=" + group + " gid=-99"),
                               errorLine("setFileOwnersAndPermissions: group " + group +
                                         " does not exist.")),
                          errorLine("createFile: Cannot set the file permissions"), kDeleted)));
    EXPECT_FALSE(pathExists(path));
  }
}

TEST_P(CreateFile, LeavesNoFileWhenItsOwnerOrItsModeCannotBeSet) {
  std::string path = temp_.path("new");
  const int open_before = openDescriptors();
  const std::pair<Call, std::string> cases[] = {
      {Call::fchown, "setFileOwnersAndPermissions: chown failed with errno=5."},
      {Call::fchmod, "setFileOwnersAndPermissions: chmod failed with errno=5."},
  };
  for (const auto& [failing, text] : cases) {
    SCOPED_TRACE(text);
    const FailingCall change(failing, EIO);
    const FailingCall closed(Call::close, EIO);  // not reported

    EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));

    ASSERT_TRUE(change.fired());
    ASSERT_TRUE(closed.fired());
    EXPECT_EQ(trail(),
              traced(call("createFile", 0, missing(),
                          call("setFileOwnersAndPermissions", 0, ownAccount(), errorLine(text)),
                          errorLine("createFile: Cannot set the file permissions"), kDeleted)));
    EXPECT_FALSE(pathExists(path));
    EXPECT_EQ(openDescriptors(), open_before);
    EXPECT_EQ(currentUmask(), 026U);
  }
}

TEST_P(CreateFile, ByAnOrdinaryUserForAnotherOneLeavesNothing) {
  REQUIRE_ROOT("to become another user");
  std::string user = getpwuid(0)->pw_name;
  std::string path = temp_.path("new");
  const Permissions shared(temp_.path(), 0777);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EXPECT_FALSE(createFile(path.data(), user.data(), nullptr, 0640));
                     return 0;
                   }),
            0);
  EXPECT_FALSE(pathExists(path));
}

TEST_P(CreateFile, ReportsAFailedCloseAndKeepsTheFile) {
  std::string path = temp_.path("new");
  const int open_before = openDescriptors();
  const FailingCall closed(Call::close, EIO);

  EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0604));

  ASSERT_TRUE(closed.fired());
  EXPECT_EQ(trail(), traced(call("createFile", 0, missing(), givenToOwnAccount(),
                                 debugLine("createFile: close - errno =5"))));
  EXPECT_EQ(modeOf(path), 0604U);
  EXPECT_EQ(statusOf(path).st_uid, getuid());
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CreateFile, SetsTheMaskBeforeItOpensAndNotEarlier) {
  std::string path = temp_.file("file", "old contents");
  mode_t at_removal = 0;
  mode_t at_open = 0;
  const BeforeCall removal(Call::remove, [&] { at_removal = currentUmask(); });
  const BeforeCall opened(Call::open64, [&] { at_open = currentUmask(); });

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(removal.fired() && opened.fired());
  EXPECT_EQ(at_removal, 022U);
  EXPECT_EQ(at_open, 026U);
}

// ---- deleteFile ----

TEST_P(DeleteFile, RefusesANullPath) {
  EXPECT_FALSE(deleteFile(nullptr));
  EXPECT_EQ(trail(),
            traced(call("deleteFile", 0, debugLine("deleteFile: passed a null pointer."))));
}

TEST_P(DeleteFile, RemovesAFile) {
  std::string path = temp_.file("file", "text");
  EXPECT_TRUE(deleteFile(path.data()));
  EXPECT_EQ(trail(), traced(kDeleted));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(DeleteFile, RemovesAPipeWithoutOpeningIt) {
  std::string path = temp_.path("fifo");
  makeFifo(path);
  EXPECT_TRUE(deleteFile(path.data()));
  EXPECT_FALSE(pathExists(path));
}

TEST_P(DeleteFile, RemovesALinkAndNotItsTarget) {
  const std::string target = temp_.file("target", "kept");
  std::string link = temp_.path("link");
  makeLink(target, link);
  EXPECT_TRUE(deleteFile(link.data()));
  EXPECT_FALSE(pathExists(link));
  EXPECT_EQ(contentsOf(target), "kept");
}

TEST_P(DeleteFile, RemovesADanglingLink) {
  std::string link = temp_.path("link");
  makeLink(temp_.path("nothing"), link);
  EXPECT_TRUE(deleteFile(link.data()));
  EXPECT_EQ(trail(), traced(call("deleteFile", 1, query("isDirectory", 0, ENOENT))));
  EXPECT_FALSE(pathExists(link));
}

TEST_P(DeleteFile, LeavesADirectoryALinkToOneAndASocket) {
  std::string directory = temp_.dir("empty");
  std::string link = temp_.path("link");
  std::string socket = temp_.path("socket");
  makeLink(directory, link);
  makeSocket(socket);
  for (std::string path : {directory, link, socket}) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(deleteFile(path.data()));
    EXPECT_EQ(trail(), traced(call("deleteFile", 0, yes("isDirectory"))));
    EXPECT_TRUE(pathExists(path));
  }
}

TEST_P(DeleteFile, ReportsAPathThatIsNotThere) {
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (auto [path, reason] : cases) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(deleteFile(path.data()));
    EXPECT_EQ(trail(),
              traced(call("deleteFile", 0, query("isDirectory", 0, reason),
                          debugLine("deleteFile: remove - errno =" + std::to_string(reason)))));
  }
}

TEST_P(DeleteFile, ReportsWhyTheFileStays) {
  std::string path = temp_.file("file", "text");
  const FailingCall removal(Call::remove, EBUSY);
  EXPECT_FALSE(deleteFile(path.data()));
  ASSERT_TRUE(removal.fired());
  EXPECT_EQ(trail(), traced(call("deleteFile", 0, no("isDirectory"),
                                 debugLine("deleteFile: remove - errno =16"))));
  EXPECT_EQ(contentsOf(path), "text");
}

TEST_P(DeleteFile, LeavesWhatMayNotBeRemoved) {
  std::string path = temp_.file("file", "text");
  const Permissions fixed(temp_.path(), 0555);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(deleteFile(path.data()));
              EXPECT_EQ(trail(), traced(call("deleteFile", 0, no("isDirectory"),
                                             debugLine("deleteFile: remove - errno =13"))));
              return 0;
            }),
            0);
  EXPECT_TRUE(pathExists(path));
}

}  // namespace
