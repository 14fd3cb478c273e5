// Files: the queries, the operations on whole files, and who owns a file.

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "calls.h"
#include "cancelled.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "small_stack.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// ---- What calls leave in the trace ----

Trail debug(const std::string& text) { return {"D " + text + "\n"}; }
Trail error(const std::string& text) { return {"E " + text + "\n"}; }

// A query whose look at the path failed.
Trail query(const std::string& name, long code, int error_number) {
  return call(name, code, debug(name + ": stat() - errno=" + std::to_string(error_number)));
}
// Both questions about a path that does not exist.
Trail missing() {
  return joined(query("doesFileExist", 0, ENOENT), query("canAccessFile", 1, ENOENT));
}
// Both questions about a path that permissions hide.
Trail hidden() {
  return joined(query("doesFileExist", 0, EACCES), query("canAccessFile", 0, EACCES));
}

gid_t ownGroup() {
  const passwd* const user = getpwuid(getuid());
  return user == nullptr ? 0 : user->pw_gid;
}

Trail ownAccount() {
  const std::string gid = std::to_string(ownGroup());
  return joined(debug("vra_get_uid: name=NULL uid=" + std::to_string(getuid())),
                debug("vra_get_usr_gid: name=NULL gid=" + gid),
                debug("vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid));
}
Trail givenToOwnAccount() { return call("setFileOwnersAndPermissions", 1, ownAccount()); }
Trail createdForOwnAccount() { return call("createFile", 1, missing(), givenToOwnAccount()); }
Trail deleted() { return call("deleteFile", 1, no("isDirectory")); }
Trail writable() { return call("canWriteToFile", 1, no("isDirectory")); }
// A source that copyFile accepts.
Trail goodSource() { return joined(yes("doesFileExist"), yes("canAccessFile"), no("isDirectory")); }

// ---- The world around a test ----

class Umask {
 public:
  explicit Umask(mode_t mask) : before_(umask(mask)) {}
  ~Umask() { umask(before_); }
  Umask(const Umask&) = delete;
  Umask& operator=(const Umask&) = delete;

 private:
  mode_t before_;
};

mode_t currentUmask() {
  const mode_t mask = umask(0);
  umask(mask);
  return mask;
}

// Gives a path these permission bits until the end of the scope.
class Permissions {
 public:
  Permissions(std::string path, mode_t mode) : path_(std::move(path)), before_(modeOf(path_)) {
    EXPECT_EQ(chmod(path_.c_str(), mode), 0) << path_;
  }
  ~Permissions() { chmod(path_.c_str(), before_); }
  Permissions(const Permissions&) = delete;
  Permissions& operator=(const Permissions&) = delete;

 private:
  std::string path_;
  mode_t before_;
};

// Runs the body in a child process that permission bits stop: they do not stop root.
int asOrdinaryUser(const std::function<int()>& body) {
  return geteuid() == 0 ? asUser(kNobody, body) : inChild(body);
}

struct stat64 statusOf(const std::string& path) {
  struct stat64 status = {};
  EXPECT_EQ(lstat64(path.c_str(), &status), 0) << path;
  return status;
}

void makeLink(const std::string& target, const std::string& name) {
  EXPECT_EQ(symlink(target.c_str(), name.c_str()), 0) << name;
}
void makeHardLink(const std::string& file, const std::string& name) {
  EXPECT_EQ(link(file.c_str(), name.c_str()), 0) << name;
}
void makeFifo(const std::string& path) { EXPECT_EQ(mkfifo(path.c_str(), 0666), 0) << path; }
void makeSocket(const std::string& path) {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  path.copy(address.sun_path, path.size());
  const int socket_descriptor = socket(AF_UNIX, SOCK_STREAM, 0);
  EXPECT_EQ(bind(socket_descriptor, reinterpret_cast<sockaddr*>(&address), sizeof address), 0)
      << path;
  close(socket_descriptor);
}

std::string randomBytes(size_t size) {
  std::string bytes(size, '\0');
  std::minstd_rand next(static_cast<unsigned>(size) + 1);
  for (char& byte : bytes) byte = static_cast<char>(next());
  return bytes;
}

// Each test of this kind runs with tracing on, and again with it off.
class FileTest : public testing::TestWithParam<bool> {
 protected:
  // What arrived since the last question.
  Trail trail() {
    const Trail arrived = records_.trail();
    records_.clear();
    return arrived;
  }
  // What must have arrived: these calls, or nothing with tracing off.
  template <typename... Calls>
  Trail traced(const Calls&... calls) const {
    return GetParam() ? joined(calls...) : Trail();
  }

  const Umask umask_{022};
  const TempDir temp_;
  Records records_{GetParam() ? kAllEvents : uint64_t{0}};
};

#define TRACED_AND_NOT(suite)                                                        \
  class suite : public FileTest {};                                                  \
  INSTANTIATE_TEST_SUITE_P(Tracing, suite, testing::Bool(), [](const auto& tested) { \
    return std::string(tested.param ? "On" : "Off");                                 \
  })

TRACED_AND_NOT(FileQueries);
TRACED_AND_NOT(CanWriteToFile);
TRACED_AND_NOT(CheckFilePerms);
TRACED_AND_NOT(CreateFile);
TRACED_AND_NOT(CopyFile);
TRACED_AND_NOT(DeleteFile);
TRACED_AND_NOT(ClearFile);
TRACED_AND_NOT(ReadFile);
TRACED_AND_NOT(GetFileNameFromPath);
TRACED_AND_NOT(GetFileOwners);

// ---- doesFileExist, canAccessFile, isDirectory, isFile ----

TEST_P(FileQueries, RefuseANullPath) {
  EXPECT_FALSE(doesFileExist(nullptr));
  EXPECT_EQ(trail(),
            traced(call("doesFileExist", 0, debug("doesFileExist: passed a null pointer."))));
  EXPECT_FALSE(canAccessFile(nullptr));
  EXPECT_EQ(trail(),
            traced(call("canAccessFile", 0, debug("canAccessFile: passed a null pointer."))));
  EXPECT_FALSE(isDirectory(nullptr));
  EXPECT_EQ(trail(), traced(call("isDirectory", 0, debug("isDirectory: passed a null pointer."))));
  EXPECT_FALSE(isFile(nullptr));
  EXPECT_EQ(trail(), traced(call("isFile", 0, debug("isFile: passed a null pointer."))));
}

TEST_P(FileQueries, JudgeAPathByTheTypeOfWhatItLeadsTo) {
  const std::string file = temp_.file("file", "text");
  const std::string directory = temp_.dir("directory");
  makeLink(file, temp_.path("link to file"));
  makeLink(directory, temp_.path("link to directory"));
  makeFifo(temp_.path("fifo"));
  makeSocket(temp_.path("socket"));

  struct Case {
    std::string path;
    bool directory;
    bool file;
  };
  const Case cases[] = {
      {file, false, true},
      {directory, true, false},
      {directory + "/", true, false},
      {temp_.path("link to file"), false, true},
      {temp_.path("link to directory"), true, false},
      {temp_.path("fifo"), false, false},
      {temp_.path("socket"), true, true},  // its type has the bits of both
      {"/dev/null", false, false},
  };
  for (Case each : cases) {
    SCOPED_TRACE(each.path);
    // A pipe that were opened would wait for its other end.
    const FailingCall opened(Call::open64, EIO);
    const FailingCall stream_opened(Call::fopen64, EIO);
    EXPECT_TRUE(doesFileExist(each.path.c_str()));
    EXPECT_EQ(trail(), traced(yes("doesFileExist")));
    EXPECT_TRUE(canAccessFile(each.path.c_str()));
    EXPECT_EQ(trail(), traced(yes("canAccessFile")));
    EXPECT_EQ(isDirectory(each.path.c_str()), each.directory);
    EXPECT_EQ(trail(), traced(call("isDirectory", each.directory)));
    EXPECT_EQ(isFile(each.path.data()), each.file);
    EXPECT_EQ(trail(), traced(call("isFile", each.file)));
    EXPECT_EQ(opened.calls() + stream_opened.calls(), 0);
  }
}

TEST_P(FileQueries, CountABlockDeviceAsADirectory) {
  std::string device = temp_.path("block");
  if (mknod(device.c_str(), S_IFBLK | 0600, makedev(7, 250)) != 0) {
    GTEST_SKIP() << "may not make a block device: " << strerror(errno);
  }
  EXPECT_TRUE(doesFileExist(device.c_str()));
  EXPECT_TRUE(isDirectory(device.c_str()));
  EXPECT_FALSE(isFile(device.data()));
  EXPECT_FALSE(canWriteToFile(device.data()));
  EXPECT_EQ(checkFilePerms(device.c_str()), OSUTILS_CONSTRAINT_VIOLATION);
}

TEST_P(FileQueries, SayNoForAPathThatLeadsNowhere) {
  makeLink(temp_.path("nothing"), temp_.path("dangling"));
  makeLink(temp_.path("loop"), temp_.path("loop"));
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {"", ENOENT},
      {temp_.path("dangling"), ENOENT},
      {temp_.path("loop"), ELOOP},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {temp_.path(std::string(256, 'n')), ENAMETOOLONG},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (auto [path, reason] : cases) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(doesFileExist(path.c_str()));
    EXPECT_EQ(trail(), traced(query("doesFileExist", 0, reason)));
    EXPECT_TRUE(canAccessFile(path.c_str()));  // nothing forbids it
    EXPECT_EQ(trail(), traced(query("canAccessFile", 1, reason)));
    EXPECT_FALSE(isDirectory(path.c_str()));
    EXPECT_EQ(trail(), traced(query("isDirectory", 0, reason)));
    EXPECT_FALSE(isFile(path.data()));
    EXPECT_EQ(trail(), traced(query("isFile", 0, reason)));
  }
}

TEST_P(FileQueries, SayNoForAPathThatPermissionsHide) {
  const std::string closed = temp_.dir("closed");
  std::string inside = temp_.file("closed/inside", "text");
  const Permissions unsearchable(closed, 0);

  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(doesFileExist(inside.c_str()));
              EXPECT_EQ(trail(), traced(query("doesFileExist", 0, EACCES)));
              EXPECT_FALSE(canAccessFile(inside.c_str()));
              EXPECT_EQ(trail(), traced(query("canAccessFile", 0, EACCES)));
              EXPECT_FALSE(isDirectory(inside.c_str()));
              EXPECT_EQ(trail(), traced(query("isDirectory", 0, EACCES)));
              EXPECT_FALSE(isFile(inside.data()));
              EXPECT_EQ(trail(), traced(query("isFile", 0, EACCES)));
              // The directory itself is not hidden.
              EXPECT_TRUE(doesFileExist(closed.c_str()));
              EXPECT_TRUE(canAccessFile(closed.c_str()));
              return 0;
            }),
            0);
}

TEST_P(FileQueries, SayNoWheneverTheStatusCannotBeHad) {
  std::string file = temp_.file("file", "text");
  for (const int reason : {EIO, ENOMEM, EOVERFLOW, EACCES}) {
    SCOPED_TRACE(reason);
    {
      const FailingCall status(Call::stat64, reason);
      EXPECT_FALSE(doesFileExist(file.c_str()));
      ASSERT_TRUE(status.fired());
      EXPECT_EQ(trail(), traced(query("doesFileExist", 0, reason)));
    }
    {
      const FailingCall status(Call::stat64, reason);
      EXPECT_EQ(canAccessFile(file.c_str()), reason != EACCES);
      ASSERT_TRUE(status.fired());
      EXPECT_EQ(trail(), traced(query("canAccessFile", reason != EACCES, reason)));
    }
    {
      const FailingCall status(Call::stat64, reason);
      EXPECT_FALSE(isDirectory(temp_.path().c_str()));
      ASSERT_TRUE(status.fired());
      EXPECT_EQ(trail(), traced(query("isDirectory", 0, reason)));
    }
    {
      const FailingCall status(Call::stat64, reason);
      EXPECT_FALSE(isFile(file.data()));
      ASSERT_TRUE(status.fired());
      EXPECT_EQ(trail(), traced(query("isFile", 0, reason)));
    }
  }
}

TEST_P(FileQueries, LeaveNothingAllocatedOrOpen) {
  std::string file = temp_.file("file", "text");
  std::string none = temp_.path("none");
  const int open_before = openDescriptors();
  const LiveAllocations live;
  for (std::string* path : {&file, &none}) {
    (void)doesFileExist(path->c_str());
    (void)canAccessFile(path->c_str());
    (void)isDirectory(path->c_str());
    (void)isFile(path->data());
    (void)checkFilePerms(path->c_str());
    (void)canWriteToFile(path->data());
  }
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(openDescriptors(), open_before);
}

// ---- canWriteToFile ----

TEST_P(CanWriteToFile, RefusesANullPath) {
  EXPECT_FALSE(canWriteToFile(nullptr));
  EXPECT_EQ(trail(),
            traced(call("canWriteToFile", 0, debug("canWriteToFile: passed a null pointer."))));
}

TEST_P(CanWriteToFile, LeavesAnExistingFileAsItIs) {
  std::string path = temp_.file("file", "contents");
  const int open_before = openDescriptors();

  EXPECT_TRUE(canWriteToFile(path.data()));

  EXPECT_EQ(trail(), traced(writable()));
  EXPECT_EQ(contentsOf(path), "contents");
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CanWriteToFile, MakesAMissingFileAndLeavesIt) {
  for (const mode_t mask : {022U, 077U, 0U}) {
    SCOPED_TRACE(mask);
    const Umask umask(mask);
    std::string path = temp_.path("made" + std::to_string(mask));

    EXPECT_TRUE(canWriteToFile(path.data()));

    EXPECT_EQ(trail(), traced(call("canWriteToFile", 1, query("isDirectory", 0, ENOENT))));
    EXPECT_EQ(contentsOf(path), "");
    EXPECT_EQ(modeOf(path), 0666 & ~mask);
  }
}

TEST_P(CanWriteToFile, MakesTheTargetOfADanglingLink) {
  std::string link = temp_.path("dangling");
  makeLink(temp_.path("target"), link);

  EXPECT_TRUE(canWriteToFile(link.data()));

  EXPECT_EQ(contentsOf(temp_.path("target")), "");
}

TEST_P(CanWriteToFile, IsFalseForADirectoryASocketAndALinkToADirectory) {
  std::string directory = temp_.dir("directory");
  std::string socket = temp_.path("socket");
  std::string link = temp_.path("link");
  makeSocket(socket);
  makeLink(directory, link);
  for (std::string path : {directory, socket, link}) {
    SCOPED_TRACE(path);
    const FailingCall opened(Call::fopen64, EIO);
    EXPECT_FALSE(canWriteToFile(path.data()));
    EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, yes("isDirectory"))));
    EXPECT_EQ(opened.calls(), 0);
  }
}

TEST_P(CanWriteToFile, OpensAPipeForReal) {
  std::string path = temp_.path("fifo");
  makeFifo(path);
  const int reader = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  ASSERT_NE(reader, -1);
  const FailingCall opened(Call::fopen64, EIO, 2);

  EXPECT_TRUE(canWriteToFile(path.data()));

  EXPECT_EQ(opened.calls(), 1);
  EXPECT_EQ(trail(), traced(writable()));
  close(reader);
}

TEST_P(CanWriteToFile, SaysWhyTheFileCannotBeOpened) {
  std::string file = temp_.file("file", "contents");
  const FailingCall opened(Call::fopen64, EMFILE);

  EXPECT_FALSE(canWriteToFile(file.data()));

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, no("isDirectory"),
                                 debug("canWriteToFile: fopen - errno =24"))));
}

TEST_P(CanWriteToFile, FailsBelowAMissingDirectoryAndMakesNothing) {
  std::string path = temp_.path("none/file");

  EXPECT_FALSE(canWriteToFile(path.data()));

  EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, query("isDirectory", 0, ENOENT),
                                 debug("canWriteToFile: fopen - errno =2"))));
  EXPECT_FALSE(pathExists(temp_.path("none")));
}

TEST_P(CanWriteToFile, IsFalseWherePermissionIsRefused) {
  std::string file = temp_.file("file", "contents");
  std::string none = temp_.path("none");
  const Permissions read_only(file, 0444);
  const Permissions fixed(temp_.path(), 0555);

  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(canWriteToFile(file.data()));
              EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, no("isDirectory"),
                                             debug("canWriteToFile: fopen - errno =13"))));
              EXPECT_FALSE(canWriteToFile(none.data()));
              EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, query("isDirectory", 0, ENOENT),
                                             debug("canWriteToFile: fopen - errno =13"))));
              return 0;
            }),
            0);
  EXPECT_FALSE(pathExists(none));
}

TEST_P(CanWriteToFile, IsFalseOnAReadOnlyFileSystem) {
  REQUIRE_ROOT("to mount a file system");
  const std::string place = temp_.dir("mount");
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", place.c_str(), "tmpfs", MS_RDONLY, nullptr), 0);
              std::string path = place + "/file";
              EXPECT_FALSE(canWriteToFile(path.data()));
              EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, query("isDirectory", 0, ENOENT),
                                             debug("canWriteToFile: fopen - errno =30"))));
              return 0;
            }),
            0);
}

// ---- checkFilePerms ----

TEST_P(CheckFilePerms, RefusesANullPath) {
  EXPECT_EQ(checkFilePerms(nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(trail(),
            traced(call("checkFilePerms", 89, debug("checkFilePerms: passed a null pointer."))));
}

TEST_P(CheckFilePerms, AcceptsAFileWhateverItsPermissionBits) {
  const std::string file = temp_.file("file", "text");
  for (const mode_t mode : {0644U, 0U, 0777U}) {
    SCOPED_TRACE(mode);
    const Permissions permissions(file, mode);
    EXPECT_EQ(asOrdinaryUser([&] {
                EXPECT_EQ(checkFilePerms(file.c_str()), OSUTILS_SUCCESS);
                EXPECT_EQ(trail(), traced(call("checkFilePerms", 0, yes("doesFileExist"),
                                               no("isDirectory"))));
                return 0;
              }),
              0);
  }
}

TEST_P(CheckFilePerms, AcceptsAPipeWithoutOpeningIt) {
  makeFifo(temp_.path("fifo"));
  EXPECT_EQ(checkFilePerms(temp_.path("fifo").c_str()), OSUTILS_SUCCESS);
  EXPECT_EQ(trail(), traced(call("checkFilePerms", 0, yes("doesFileExist"), no("isDirectory"))));
}

TEST_P(CheckFilePerms, ReportsADirectoryAsAnError) {
  const std::string directory = temp_.dir("100%s%n");  // no format string
  makeLink(directory, temp_.path("link"));
  makeSocket(temp_.path("socket"));
  for (const std::string& path : {directory, temp_.path("link"), temp_.path("socket")}) {
    SCOPED_TRACE(path);
    EXPECT_EQ(checkFilePerms(path.c_str()), OSUTILS_CONSTRAINT_VIOLATION);
    EXPECT_EQ(trail(), traced(call("checkFilePerms", 19, yes("doesFileExist"), yes("isDirectory"),
                                   error("checkFilePerms - " + path + " is a directory."))));
  }
}

TEST_P(CheckFilePerms, ReportsAMissingFile) {
  makeLink(temp_.path("nothing"), temp_.path("dangling"));
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {temp_.path("dangling"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    EXPECT_EQ(checkFilePerms(path.c_str()), OSUTILS_NO_SUCH_OBJECT);
    EXPECT_EQ(trail(),
              traced(call("checkFilePerms", 32, query("doesFileExist", 0, reason),
                          query("canAccessFile", 1, reason),
                          debug("checkFilePerms - The file " + path + " does not exist."))));
  }
}

TEST_P(CheckFilePerms, ReportsAFileThatPermissionsHide) {
  const std::string closed = temp_.dir("closed");
  const std::string inside = temp_.file("closed/inside", "text");
  const Permissions unsearchable(closed, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_EQ(checkFilePerms(inside.c_str()), OSUTILS_INSUFFICIENT_ACCESS);
              EXPECT_EQ(trail(), traced(call("checkFilePerms", 50, hidden(),
                                             debug("checkFilePerms - The file " + inside +
                                                   " cannot be accessed."))));
              return 0;
            }),
            0);
}

TEST_P(CheckFilePerms, GoesByTheLastAnswerWhenThePathChangesMeanwhile) {
  const std::string path = temp_.file("file", "text");
  {
    const BeforeCall second(
        Call::stat64, [&] { unlink(path.c_str()); }, 2);
    EXPECT_EQ(checkFilePerms(path.c_str()), OSUTILS_SUCCESS);
    ASSERT_TRUE(second.fired());
    EXPECT_EQ(trail(), traced(call("checkFilePerms", 0, yes("doesFileExist"),
                                   query("isDirectory", 0, ENOENT))));
  }
  const BeforeCall second(
      Call::stat64, [&] { writeFile(path, "back"); }, 2);
  EXPECT_EQ(checkFilePerms(path.c_str()), OSUTILS_NO_SUCH_OBJECT);
  ASSERT_TRUE(second.fired());
  EXPECT_EQ(trail(), traced(call("checkFilePerms", 32, query("doesFileExist", 0, ENOENT),
                                 yes("canAccessFile"),
                                 debug("checkFilePerms - The file " + path + " does not exist."))));
}

// ---- createFile ----

TEST_P(CreateFile, RefusesANullPath) {
  EXPECT_FALSE(createFile(nullptr, nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("createFile", 0, debug("createFile: passed a null pointer."))));
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
  makeHardLink(path, temp_.path("old"));  // keeps the inode from being used again

  EXPECT_TRUE(createFile(path.data(), nullptr, nullptr, 0606));

  EXPECT_EQ(trail(),
            traced(call("createFile", 1, yes("doesFileExist"), deleted(), givenToOwnAccount())));
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
  EXPECT_EQ(
      trail(),
      traced(call("createFile", 1, yes("doesFileExist"),
                  call("deleteFile", 0, no("isDirectory"), debug("deleteFile: remove - errno =16")),
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
                                 error("createFile: open - errno =21"))));
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
                                             error("createFile: open - errno =13"))));
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
    EXPECT_EQ(trail(), traced(call("createFile", 0, query("doesFileExist", 0, reason),
                                   query("canAccessFile", 1, reason),
                                   error("createFile: open - errno =" + std::to_string(reason)))));
  }
}

TEST_P(CreateFile, HasRemovedTheOldFileWhenTheOpenFails) {
  std::string path = temp_.file("file", "old contents");
  const FailingCall opened(Call::open64, ENFILE);

  EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(), traced(call("createFile", 0, yes("doesFileExist"), deleted(),
                                 error("createFile: open - errno =23"))));
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
      traced(call(
          "createFile", 0, yes("doesFileExist"), deleted(),
          call("setFileOwnersAndPermissions", 0, debug("vra_get_uid: name=no-such-user uid=-99"),
               debug("setFileOwnersAndPermissions: user no-such-user does not exist.")),
          error("createFile: Cannot set the file permissions"), deleted())));
  EXPECT_FALSE(pathExists(path));
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CreateFile, LeavesNoFileOfAnUnknownGroup) {
  std::string path = temp_.path("new");
  for (std::string group : {std::string("no-such-group"), std::string()}) {
    SCOPED_TRACE(group);
    EXPECT_FALSE(createFile(path.data(), nullptr, group.data(), 0640));
    const std::string gid = std::to_string(ownGroup());
    EXPECT_EQ(
        trail(),
        traced(call("createFile", 0, missing(),
                    call("setFileOwnersAndPermissions", 0,
                         debug("vra_get_uid: name=NULL uid=" + std::to_string(getuid())),
                         debug("vra_get_usr_gid: name=NULL gid=" + gid),
                         debug("vra_getgrnam_gid: name=" + group + " gid=-99"),
                         error("setFileOwnersAndPermissions: group " + group + " does not exist.")),
                    error("createFile: Cannot set the file permissions"), deleted())));
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
    const FailingCall closed(Call::close, EIO);  // goes unnoticed here

    EXPECT_FALSE(createFile(path.data(), nullptr, nullptr, 0640));

    ASSERT_TRUE(change.fired());
    ASSERT_TRUE(closed.fired());
    EXPECT_EQ(trail(),
              traced(call("createFile", 0, missing(),
                          call("setFileOwnersAndPermissions", 0, ownAccount(), error(text)),
                          error("createFile: Cannot set the file permissions"), deleted())));
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
                                 debug("createFile: close - errno =5"))));
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

// ---- Cancellation ----

// Every call that a file operation makes, as the one that a request to end the thread comes with.
// The operation is finished all the same, and the thread ends behind it.
class CancelledFile : public FileTest {
 protected:
  void expectFinished(std::initializer_list<Call> calls, const std::function<bool()>& operation,
                      const std::function<void()>& look) const {
    for (const Call at : calls) {
      SCOPED_TRACE(static_cast<int>(at));
      int asked = 0;
      for (int nth = 1;; ++nth) {
        SCOPED_TRACE(nth);
        const int open_before = openDescriptors();
        bool answer = false;
        const CancelledCall call = cancelledAt(at, nth, [&] { answer = operation(); });
        ASSERT_TRUE(call.returned);
        EXPECT_TRUE(answer);
        EXPECT_EQ(call.blocks, 0);
        EXPECT_EQ(openDescriptors(), open_before);
        look();
        EXPECT_EQ(call.ended, call.asked);
        if (!call.asked) break;
        ++asked;
      }
      EXPECT_GT(asked, 0) << "the operation makes no such call";
    }
  }
};
INSTANTIATE_TEST_SUITE_P(Tracing, CancelledFile, testing::Bool(), [](const auto& tested) {
  return std::string(tested.param ? "On" : "Off");
});

TEST_P(CancelledFile, IsMade) {
  std::string path = temp_.file("file", "old");
  EXPECT_EQ(inChild([&] {
              expectFinished(
                  {Call::stat64, Call::remove, Call::umask, Call::open64, Call::fchown,
                   Call::fchmod, Call::close},
                  [&] { return createFile(path.data(), nullptr, nullptr, 0640); },
                  [&] { EXPECT_EQ(contentsOf(path), ""); });
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsCopied) {
  const std::string contents = randomBytes(100'000);
  const std::string source = temp_.file("source", contents);
  std::string made = temp_.path("made");
  std::string there = temp_.file("there", "old");
  EXPECT_EQ(inChild([&] {
              for (std::string* const to : {&made, &there}) {
                expectFinished(
                    {Call::stat64, Call::fopen64, Call::copy_file_range, Call::read, Call::fclose},
                    [&] { return copyFile(source.c_str(), to->data(), nullptr, nullptr, 0640); },
                    [&] {
                      EXPECT_TRUE(contentsOf(*to) == contents);
                      if (to == &made) unlink(made.c_str());
                    });
              }
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsProbed) {
  std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              expectFinished(
                  {Call::stat64, Call::fopen64, Call::fclose},
                  [&] { return canWriteToFile(path.data()); }, [] {});
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsRead) {
  const std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              char* read = nullptr;
              expectFinished(
                  {Call::stat64, Call::fopen64, Call::fread, Call::fclose},
                  [&] {
                    const bool answer = readFile(path.c_str(), &read);
                    // The buffer is the caller's.
                    EXPECT_EQ(std::string(read, 8), "contents");
                    free(read);
                    return answer;
                  },
                  [] {});
              return 0;
            }),
            0);
}

// The lock is the one place where the operation may end: before it, the file is as it was.
TEST_P(CancelledFile, IsEmptiedOrNot) {
  const std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              for (const Call at : {Call::stat64, Call::open64, Call::lockf64}) {
                SCOPED_TRACE(static_cast<int>(at));
                const int open_before = openDescriptors();
                const CancelledCall call =
                    cancelledAt(at, 1, [&] { (void)clearFile(path.c_str()); });
                EXPECT_TRUE(call.asked && call.ended);
                EXPECT_FALSE(call.returned);
                EXPECT_EQ(openDescriptors(), open_before);
                EXPECT_EQ(contentsOf(path), "contents");
              }
              expectFinished(
                  {Call::ftruncate64, Call::close}, [&] { return clearFile(path.c_str()); },
                  [&] { EXPECT_EQ(contentsOf(path), ""); });
              return 0;
            }),
            0);
}

// Waits for a lock that another process keeps, until it is cancelled.
TEST_P(CancelledFile, IsNotEmptiedByAThreadThatEndsWhileItWaits) {
  const std::string path = temp_.file("file", "contents");
  int held[2];
  ASSERT_EQ(pipe2(held, O_CLOEXEC), 0);
  const pid_t holder = fork();
  ASSERT_NE(holder, -1);
  if (holder == 0) {
    char token = 'x';
    const int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
    if (lockf64(descriptor, F_LOCK, 0) == 0 && write(held[1], &token, 1) == 1) pause();
    _exit(1);
  }
  char token = 'x';
  ASSERT_EQ(read(held[0], &token, 1), 1);
  EXPECT_EQ(inChild([&] {
              const int open_before = openDescriptors();
              // Asked before it waits, and while it does.
              const CancelledCall before =
                  cancelledAt(Call::lockf64, 1, [&] { (void)clearFile(path.c_str()); });
              EXPECT_TRUE(before.asked && before.ended);
              EXPECT_FALSE(before.returned);
              EXPECT_EQ(openDescriptors(), open_before);

              pthread_t thread;
              const auto wait = [](void* file) -> void* {
                (void)clearFile(static_cast<const char*>(file));
                return nullptr;
              };
              EXPECT_EQ(pthread_create(&thread, nullptr, wait, const_cast<char*>(path.c_str())), 0);
              while (openDescriptors() == open_before) usleep(1'000);
              usleep(20'000);
              EXPECT_EQ(pthread_cancel(thread), 0);
              void* answer = nullptr;
              EXPECT_EQ(pthread_join(thread, &answer), 0);
              EXPECT_EQ(answer, PTHREAD_CANCELED);
              EXPECT_EQ(openDescriptors(), open_before);
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(path), "contents");
  EXPECT_EQ(kill(holder, SIGKILL), 0);
  int status = 0;
  EXPECT_EQ(waitpid(holder, &status, 0), holder);
  for (const int descriptor : held) close(descriptor);
}

// A thread that had cancellation off has it off afterwards, and waits on.
TEST_P(CancelledFile, LeavesTheStateOfTheThreadAsItWas) {
  const std::string path = temp_.file("file", "contents");
  std::string made = temp_.path("made");
  for (const int wanted : {PTHREAD_CANCEL_ENABLE, PTHREAD_CANCEL_DISABLE}) {
    int before = 0;
    ASSERT_EQ(pthread_setcancelstate(wanted, &before), 0);
    EXPECT_TRUE(clearFile(path.c_str()));
    EXPECT_TRUE(createFile(made.data(), nullptr, nullptr, 0640));
    int after = -1;
    ASSERT_EQ(pthread_setcancelstate(before, &after), 0);
    EXPECT_EQ(after, wanted);
  }
  EXPECT_EQ(inChild([&] {
              const CancelledCall call = cancelledAt(Call::lockf64, 1, [&] {
                int before = 0;
                (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &before);
                EXPECT_TRUE(clearFile(path.c_str()));
                (void)pthread_setcancelstate(before, nullptr);
              });
              EXPECT_TRUE(call.asked && call.returned && call.ended);
              return 0;
            }),
            0);
}

// ---- deleteFile ----

TEST_P(DeleteFile, RefusesANullPath) {
  EXPECT_FALSE(deleteFile(nullptr));
  EXPECT_EQ(trail(), traced(call("deleteFile", 0, debug("deleteFile: passed a null pointer."))));
}

TEST_P(DeleteFile, RemovesAFile) {
  std::string path = temp_.file("file", "text");
  EXPECT_TRUE(deleteFile(path.data()));
  EXPECT_EQ(trail(), traced(deleted()));
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
                          debug("deleteFile: remove - errno =" + std::to_string(reason)))));
  }
}

TEST_P(DeleteFile, ReportsWhyTheFileStays) {
  std::string path = temp_.file("file", "text");
  const FailingCall removal(Call::remove, EBUSY);
  EXPECT_FALSE(deleteFile(path.data()));
  ASSERT_TRUE(removal.fired());
  EXPECT_EQ(trail(), traced(call("deleteFile", 0, no("isDirectory"),
                                 debug("deleteFile: remove - errno =16"))));
  EXPECT_EQ(contentsOf(path), "text");
}

TEST_P(DeleteFile, LeavesWhatMayNotBeRemoved) {
  std::string path = temp_.file("file", "text");
  const Permissions fixed(temp_.path(), 0555);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(deleteFile(path.data()));
              EXPECT_EQ(trail(), traced(call("deleteFile", 0, no("isDirectory"),
                                             debug("deleteFile: remove - errno =13"))));
              return 0;
            }),
            0);
  EXPECT_TRUE(pathExists(path));
}

// ---- copyFile ----

TEST_P(CopyFile, RefusesANullPath) {
  std::string path = temp_.file("file", "text");
  EXPECT_FALSE(copyFile(nullptr, path.data(), nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("copyFile", 0, debug("copyFile: passed a null pointer."))));
  EXPECT_FALSE(copyFile(path.c_str(), nullptr, nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("copyFile", 0, debug("copyFile: passed a null pointer."))));
  EXPECT_EQ(contentsOf(path), "text");
}

TEST_P(CopyFile, MakesAMissingDestination) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  const int open_before = openDescriptors();

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0604));

  EXPECT_EQ(trail(), traced(call("copyFile", 1, goodSource(), query("doesFileExist", 0, ENOENT),
                                 query("canAccessFile", 1, ENOENT), createdForOwnAccount())));
  EXPECT_EQ(contentsOf(destination), "contents");
  EXPECT_EQ(contentsOf(source), "contents");
  EXPECT_EQ(modeOf(destination), 0604U);
  EXPECT_EQ(statusOf(destination).st_uid, getuid());
  EXPECT_EQ(currentUmask(), 026U);
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(CopyFile, GivesANewDestinationToTheNamedUserAndGroup) {
  REQUIRE_ROOT("to give a file away");
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  std::string user = getpwuid(kNobody)->pw_name;
  std::string group = getgrgid(1)->gr_name;

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), user.data(), group.data(), 0600));

  EXPECT_EQ(contentsOf(destination), "contents");
  EXPECT_EQ(statusOf(destination).st_uid, kNobody);
  EXPECT_EQ(statusOf(destination).st_gid, 1U);
  EXPECT_EQ(modeOf(destination), 0600U);
}

TEST_P(CopyFile, KeepsAnExistingDestinationsInodeOwnerAndMode) {
  const std::string source = temp_.file("source", "short");
  std::string destination = temp_.file("destination", "much longer contents");
  if (geteuid() == 0) {
    ASSERT_EQ(chown(destination.c_str(), kNobody, 1), 0);
  }
  const Permissions mode(destination, 0602);
  const struct stat64 before = statusOf(destination);
  std::string user = "no-such-user";  // not even looked up

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), user.data(), nullptr, 0777));

  EXPECT_EQ(trail(), traced(call("copyFile", 1, goodSource(), yes("doesFileExist"), writable())));
  EXPECT_EQ(contentsOf(destination), "short");
  const struct stat64 after = statusOf(destination);
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_uid, before.st_uid);
  EXPECT_EQ(after.st_gid, before.st_gid);
  EXPECT_EQ(after.st_mode, before.st_mode);
  EXPECT_EQ(currentUmask(), 022U);
}

TEST_P(CopyFile, CopiesEverySizeWithAndWithoutTheKernelsHelp) {
  std::string destination = temp_.path("destination");
  const size_t sizes[] = {0,     1,     4095,   4096,    4097,          65535,
                          65536, 65537, 131072, 1 << 20, (1 << 20) + 1, (3 << 20) + 17};
  for (const size_t size : sizes) {
    SCOPED_TRACE(size);
    const std::string contents = randomBytes(size);
    const std::string source = temp_.file("source", contents);
    EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
    EXPECT_TRUE(contentsOf(destination) == contents);
    for (const int reason : {EXDEV, EINVAL, ENOSYS, EOPNOTSUPP, EIO}) {
      SCOPED_TRACE(reason);
      const FailingCall kernel_copy(Call::copy_file_range, reason);
      EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
      ASSERT_TRUE(kernel_copy.fired());
      EXPECT_TRUE(contentsOf(destination) == contents);
    }
  }
}

TEST_P(CopyFile, CopiesTheRestItselfWhenTheKernelStopsHalfWay) {
  const std::string beginning = randomBytes(100'000);
  const std::string rest = randomBytes(200'001);
  const std::string source = temp_.file("source", beginning);
  std::string destination = temp_.path("destination");
  // The second call would move what is new since the first, but it fails.
  const BeforeCall grown(
      Call::copy_file_range, [&] { writeFile(source, beginning + rest); }, 2);
  const FailingCall kernel_copy(Call::copy_file_range, EXDEV, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(grown.fired() && kernel_copy.fired());
  EXPECT_TRUE(contentsOf(destination) == beginning + rest);
}

// What is said here of the kernel's copy holds for the one between two file systems.
TEST_P(CopyFile, CopiesBetweenFileSystemsAsFarAsTheKernelDoes) {
  const std::string contents = randomBytes(300'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  const FailingCall other_file_system(Call::copy_file_range, EXDEV, 1, kNever);
  {
    const FailingCall interrupted(Call::sendfile64, EINTR, 1, 3);
    const FailingCall reading(Call::read, EIO, kNever);
    EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
    ASSERT_TRUE(interrupted.fired());
    EXPECT_EQ(reading.calls(), 1) << "only the look for more at the end";
    EXPECT_TRUE(contentsOf(destination) == contents);
  }
  for (const int reason : {EINVAL, ENOSYS, EIO}) {
    SCOPED_TRACE(reason);
    const FailingCall refused(Call::sendfile64, reason);
    EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
    ASSERT_TRUE(refused.fired());
    EXPECT_TRUE(contentsOf(destination) == contents);
  }
  const std::string more = randomBytes(50'000);
  const BeforeCall grown(
      Call::sendfile64, [&] { writeFile(source, contents + more); }, 2);
  const FailingCall stopped(Call::sendfile64, EIO, 2);
  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
  ASSERT_TRUE(grown.fired() && stopped.fired());
  EXPECT_TRUE(contentsOf(destination) == contents + more);
}

TEST_P(CopyFile, KeepsToASmallStack) {
  REQUIRE_OWN_MALLOC();  // and the frames
  const std::string contents = randomBytes(200'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.file("destination", "old");
  for (const int reason : {0, EXDEV, ENOSYS}) {
    SCOPED_TRACE(reason);
    // Once on a large stack, where the loader looks up what is called.
    for (const bool small : {false, true}) {
      bool copied = false;
      const auto copy = [&] {
        const FailingCall kernel_copy(Call::copy_file_range, reason, reason == 0 ? kNever : 1);
        copied = copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640);
      };
      if (small) {
        EXPECT_TRUE(keepsToASmallStack(copy));
      } else {
        copy();
      }
      EXPECT_TRUE(copied);
      EXPECT_TRUE(contentsOf(destination) == contents);
    }
  }
}

TEST_P(CopyFile, GoesOnAfterAnInterruptedCall) {
  const std::string contents = randomBytes(200'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  {
    const FailingCall kernel_copy(Call::copy_file_range, EINTR, 1, 3);
    EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
    EXPECT_GE(kernel_copy.calls(), 4);
    EXPECT_TRUE(contentsOf(destination) == contents);
  }
  const FailingCall kernel_copy(Call::copy_file_range, ENOSYS);
  const FailingCall reading(Call::read, EINTR, 2, 2);
  const FailingCall writing(Call::write, EINTR, 2, 2);
  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
  ASSERT_TRUE(reading.fired() && writing.fired());
  EXPECT_TRUE(contentsOf(destination) == contents);
}

TEST_P(CopyFile, EndsWhereTheSourceCannotBeReadOn) {
  const std::string contents = randomBytes(200'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  const FailingCall kernel_copy(Call::copy_file_range, ENOSYS);
  const FailingCall reading(Call::read, EIO, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(reading.fired());
  const std::string copied = contentsOf(destination);
  EXPECT_GT(copied.size(), 0U);
  EXPECT_LT(copied.size(), contents.size());
  EXPECT_TRUE(contents.starts_with(copied));
}

TEST_P(CopyFile, DoesNotReportAFailedWriteAndWritesNothingBehindTheGap) {
  const std::string contents = randomBytes(300'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  const FailingCall kernel_copy(Call::copy_file_range, ENOSYS);
  const FailingCall reading(Call::read, EIO, 1000);  // counts only
  const FailingCall writing(Call::write, ENOSPC, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(writing.fired());
  EXPECT_EQ(writing.calls(), 2);
  EXPECT_GT(reading.calls(), 3);  // the source is read to its end all the same
  const std::string copied = contentsOf(destination);
  EXPECT_GT(copied.size(), 0U);
  EXPECT_LT(copied.size(), contents.size());
  EXPECT_TRUE(contents.starts_with(copied));
}

TEST_P(CopyFile, WritesWhatFitsUnderALimitInTheMiddleOfABlock) {
  const std::string contents = randomBytes(300'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  for (const bool kernel_copies : {true, false}) {
    SCOPED_TRACE(kernel_copies);
    EXPECT_EQ(inChild([&] {
                struct rlimit before = {};
                getrlimit(RLIMIT_FSIZE, &before);
                const struct rlimit limit = {100'000, before.rlim_max};
                signal(SIGXFSZ, SIG_IGN);
                EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
                std::optional<FailingCall> kernel_copy;
                if (!kernel_copies) kernel_copy.emplace(Call::copy_file_range, ENOSYS);
                EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
                EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &before), 0);
                return 0;
              }),
              0);
    EXPECT_TRUE(contentsOf(destination) == contents.substr(0, 100'000));
  }
}

TEST_P(CopyFile, LeavesTheBeginningOnAFullFileSystem) {
  REQUIRE_ROOT("to mount a small file system");
  const std::string contents = randomBytes(1 << 20);
  const std::string source = temp_.file("source", contents);
  const std::string place = temp_.dir("small");
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", place.c_str(), "tmpfs", 0, "size=256k"), 0);
              std::string destination = place + "/destination";
              EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
              EXPECT_EQ(trail(), traced(call("copyFile", 1, goodSource(), missing(),
                                             createdForOwnAccount())));
              const std::string copied = contentsOf(destination);
              EXPECT_GT(copied.size(), 0U);
              EXPECT_LE(copied.size(), 256U << 10);
              EXPECT_TRUE(contents.starts_with(copied));
              return 0;
            }),
            0);
}

TEST_P(CopyFile, LeavesTheBeginningWhenItsOwnFileSystemRunsFull) {
  REQUIRE_ROOT("to mount a small file system");
  const std::string contents = randomBytes(150'000);
  const std::string place = temp_.dir("small");
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", place.c_str(), "tmpfs", 0, "size=256k"), 0);
              writeFile(place + "/source", contents);
              const std::string source = place + "/source";
              std::string destination = place + "/destination";
              EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
              const std::string copied = contentsOf(destination);
              EXPECT_GT(copied.size(), 0U);
              EXPECT_LT(copied.size(), contents.size());
              EXPECT_TRUE(contents.starts_with(copied));
              return 0;
            }),
            0);
}

// A file system may force a file that was truncated to the disk at its next close, which must not
// come before the contents.
TEST_P(CopyFile, ClosesANewDestinationOnlyWhenItIsMadeAndWhenItIsWhole) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  const FailingCall opened(Call::open64, EMFILE, kNever);
  const FailingCall closed(Call::close, EIO, kNever);
  const FailingCall closed_stream(Call::fclose, EIO, kNever);
  std::string at_close;
  const BeforeCall closing(
      Call::fclose, [&] { at_close = contentsOf(destination); }, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(opened.calls(), 1);
  EXPECT_EQ(closed.calls(), 1);
  EXPECT_EQ(closed_stream.calls(), 2);
  EXPECT_EQ(at_close, "contents");
}

TEST_P(CopyFile, CopiesToAnotherFileSystem) {
  REQUIRE_ROOT("to mount a file system");
  const std::string contents = randomBytes(1'234'567);
  const std::string source = temp_.file("source", contents);
  const std::string place = temp_.dir("other");
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", place.c_str(), "tmpfs", 0, nullptr), 0);
              std::string there = place + "/copy";
              std::string back = temp_.path("back");
              EXPECT_NE(statusOf(place).st_dev, statusOf(source).st_dev);
              EXPECT_TRUE(copyFile(source.c_str(), there.data(), nullptr, nullptr, 0640));
              EXPECT_TRUE(contentsOf(there) == contents);
              EXPECT_TRUE(copyFile(there.c_str(), back.data(), nullptr, nullptr, 0640));
              EXPECT_TRUE(contentsOf(back) == contents);
              return 0;
            }),
            0);
}

TEST_P(CopyFile, CopiesTheHolesOfASparseFileAsZeros) {
  const std::string source = temp_.file("source", "beginning");
  ASSERT_EQ(truncate(source.c_str(), 8 << 20), 0);
  std::ofstream(source, std::ios::binary | std::ios::app) << "end";
  std::string destination = temp_.path("destination");

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  const std::string copied = contentsOf(destination);
  EXPECT_EQ(copied.size(), (8U << 20) + 3);
  EXPECT_TRUE(copied == contentsOf(source));
}

TEST_P(CopyFile, CopiesAFileWhoseSizeIsNotKnownBeforehand) {
  const std::string contents = contentsOf("/proc/version");
  ASSERT_FALSE(contents.empty());
  ASSERT_EQ(statusOf("/proc/version").st_size, 0);
  std::string destination = temp_.path("destination");

  EXPECT_TRUE(copyFile("/proc/version", destination.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(contentsOf(destination), contents);
}

TEST_P(CopyFile, EmptiesAFileThatIsCopiedOntoItself) {
  const std::string source = temp_.path("source");
  writeFile(source, "");
  makeHardLink(source, temp_.path("hard"));
  makeLink(source, temp_.path("symbolic"));
  for (std::string destination : {source, temp_.path("hard"), temp_.path("symbolic")}) {
    SCOPED_TRACE(destination);
    writeFile(source, "contents");

    EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

    EXPECT_EQ(trail(), traced(call("copyFile", 1, goodSource(), yes("doesFileExist"), writable())));
    EXPECT_EQ(contentsOf(source), "");
  }
}

TEST_P(CopyFile, FollowsLinksAtBothEnds) {
  makeLink(temp_.file("real source", "contents"), temp_.path("source"));
  makeLink(temp_.file("real destination", "old"), temp_.path("destination"));
  std::string destination = temp_.path("destination");

  EXPECT_TRUE(copyFile(temp_.path("source").c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_TRUE(S_ISLNK(statusOf(destination).st_mode));
  EXPECT_EQ(contentsOf(temp_.path("real destination")), "contents");
}

// Sends the bytes into the pipe and says whether all of them were taken.
class PipeWriter {
 public:
  PipeWriter(const std::string& path, const std::string& bytes)
      : thread_([this, path, bytes] {
          sigset_t broken_pipe;
          sigemptyset(&broken_pipe);
          sigaddset(&broken_pipe, SIGPIPE);
          pthread_sigmask(SIG_BLOCK, &broken_pipe, nullptr);
          const int descriptor = open(path.c_str(), O_WRONLY | O_CLOEXEC);
          size_t sent = 0;
          while (sent < bytes.size()) {
            const ssize_t put = write(descriptor, bytes.data() + sent, bytes.size() - sent);
            if (put <= 0) break;
            sent += static_cast<size_t>(put);
          }
          close(descriptor);
          all_sent_ = sent == bytes.size();
        }) {}

  bool allWasTaken() {
    thread_.join();
    return all_sent_;
  }

 private:
  bool all_sent_ = false;
  std::thread thread_;
};

TEST_P(CopyFile, CopiesAPipeUntilItsWriterCloses) {
  const std::string contents = randomBytes(300'000);
  const std::string source = temp_.path("fifo");
  makeFifo(source);
  std::string destination = temp_.path("destination");
  PipeWriter writer(source, contents);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_TRUE(writer.allWasTaken());
  EXPECT_TRUE(contentsOf(destination) == contents);
}

TEST_P(CopyFile, DrainsAPipeEvenWhenNothingCanBeWritten) {
  const std::string source = temp_.path("fifo");
  makeFifo(source);
  std::string full = "/dev/full";
  PipeWriter writer(source, randomBytes(300'000));

  EXPECT_TRUE(copyFile(source.c_str(), full.data(), nullptr, nullptr, 0640));

  EXPECT_TRUE(writer.allWasTaken());
}

TEST_P(CopyFile, RefusesASourceThatIsNoFile) {
  std::string destination = temp_.path("destination");
  const std::string directory = temp_.dir("directory");
  makeSocket(temp_.path("socket"));
  for (const std::string& source : {directory, temp_.path("socket")}) {
    SCOPED_TRACE(source);
    EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
    EXPECT_EQ(trail(), traced(call("copyFile", 0, yes("doesFileExist"), yes("canAccessFile"),
                                   yes("isDirectory"))));
  }
  EXPECT_FALSE(copyFile(temp_.path("none").c_str(), destination.data(), nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("copyFile", 0, query("doesFileExist", 0, ENOENT))));
  EXPECT_FALSE(copyFile("", destination.data(), nullptr, nullptr, 0640));
  EXPECT_FALSE(pathExists(destination));
  EXPECT_EQ(currentUmask(), 022U);
}

TEST_P(CopyFile, RefusesASourceThatBecomesHiddenMeanwhile) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  const FailingCall status(Call::stat64, EACCES, 2);

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(status.fired());
  EXPECT_EQ(trail(),
            traced(call("copyFile", 0, yes("doesFileExist"), query("canAccessFile", 0, EACCES))));
  EXPECT_FALSE(pathExists(destination));
}

TEST_P(CopyFile, RefusesADirectoryAsDestination) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.dir("directory");

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(trail(), traced(call("copyFile", 0, goodSource(), yes("doesFileExist"),
                                 call("canWriteToFile", 0, yes("isDirectory")))));
  EXPECT_TRUE(std::filesystem::is_empty(destination));
  EXPECT_EQ(contentsOf(source), "contents");
}

TEST_P(CopyFile, RefusesADestinationThatMayNotBeWrittenAndLeavesIt) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.file("destination", "kept");
  const Permissions read_only(destination, 0444);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
              EXPECT_EQ(trail(), traced(call("copyFile", 0, goodSource(), yes("doesFileExist"),
                                             call("canWriteToFile", 0, no("isDirectory"),
                                                  debug("canWriteToFile: fopen - errno =13")))));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(destination), "kept");
}

TEST_P(CopyFile, RefusesAHiddenDestination) {
  const std::string source = temp_.file("source", "contents");
  const std::string closed = temp_.dir("closed");
  std::string destination = closed + "/destination";
  const Permissions unsearchable(closed, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));
              EXPECT_EQ(trail(), traced(call("copyFile", 0, goodSource(), hidden())));
              return 0;
            }),
            0);
}

TEST_P(CopyFile, ReportsADestinationThatCannotBeMade) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("none/destination");

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(trail(),
            traced(call("copyFile", 0, goodSource(), missing(),
                        call("createFile", 0, missing(), error("createFile: open - errno =2")),
                        debug("copyFile: Cannot create destination file"))));
}

TEST_P(CopyFile, LeavesNoDestinationOfAnUnknownUser) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  std::string user = "no-such-user";

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), user.data(), nullptr, 0640));

  EXPECT_EQ(trail(),
            traced(call(
                "copyFile", 0, goodSource(), missing(),
                call("createFile", 0, missing(),
                     call("setFileOwnersAndPermissions", 0,
                          debug("vra_get_uid: name=no-such-user uid=-99"),
                          debug("setFileOwnersAndPermissions: user no-such-user does not exist.")),
                     error("createFile: Cannot set the file permissions"), deleted()),
                debug("copyFile: Cannot create destination file"))));
  EXPECT_FALSE(pathExists(destination));
}

TEST_P(CopyFile, LeavesANewDestinationEmptyWhenTheSourceMayNotBeRead) {
  const std::string source = temp_.file("source", "contents");
  const std::string shared = temp_.dir("shared");
  std::string destination = shared + "/destination";
  const Permissions unreadable(source, 0);
  const Permissions for_all(shared, 0777);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0604));
              EXPECT_EQ(trail(),
                        traced(call("copyFile", 0, goodSource(), missing(), createdForOwnAccount(),
                                    error("copyFile: (1) fopen - errno =13"))));
              return 0;
            }),
            0);
  EXPECT_EQ(statusOf(destination).st_size, 0);
  EXPECT_EQ(modeOf(destination), 0604U);
}

TEST_P(CopyFile, LeavesANewDestinationEmptyWhenEitherOpenFails) {
  const std::string source = temp_.file("source", "contents");
  const int open_before = openDescriptors();
  for (const int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    std::string destination = temp_.path("destination" + std::to_string(nth));
    const FailingCall opened(Call::fopen64, ENFILE, nth);

    EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

    ASSERT_TRUE(opened.fired());
    EXPECT_EQ(trail(), traced(call("copyFile", 0, goodSource(), missing(), createdForOwnAccount(),
                                   error("copyFile: (1) fopen - errno =23"))));
    EXPECT_EQ(contentsOf(destination), "");
    EXPECT_EQ(openDescriptors(), open_before);
  }
}

TEST_P(CopyFile, LeavesAnExistingDestinationAsItIsWhenEitherOpenFails) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.file("destination", "kept");
  const int open_before = openDescriptors();
  for (const int nth : {2, 3}) {  // the first is canWriteToFile's
    SCOPED_TRACE(nth);
    const FailingCall opened(Call::fopen64, EMFILE, nth);

    EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

    ASSERT_TRUE(opened.fired());
    EXPECT_EQ(trail(), traced(call("copyFile", 0, goodSource(), yes("doesFileExist"), writable(),
                                   error("copyFile: (1) fopen - errno =24"))));
    EXPECT_EQ(contentsOf(destination), "kept");
    EXPECT_EQ(openDescriptors(), open_before);
  }
}

// The descriptor that this process has of a file, or -1.
int descriptorOf(const std::string& path) {
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    if (std::filesystem::read_symlink(entry.path(), gone) == path) {
      return std::stoi(entry.path().filename());
    }
  }
  return -1;
}
bool isOpenHere(const std::string& path) { return descriptorOf(path) != -1; }

TEST_P(CopyFile, ClosesTheSourceFirstAndDoesNotReportAFailedClose) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  bool source_open = true;
  bool destination_open = false;
  const BeforeCall second(
      Call::fclose,
      [&] {
        source_open = isOpenHere(source);
        destination_open = isOpenHere(destination);
      },
      2);
  const FailingCall closing(Call::fclose, EIO, 1, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(second.fired() && closing.fired());
  EXPECT_FALSE(source_open);
  EXPECT_TRUE(destination_open);
  EXPECT_EQ(contentsOf(destination), "contents");
}

TEST_P(CopyFile, EmptiesTheDestinationBeforeItReads) {
  const std::string source = temp_.file("source", "new");
  std::string destination = temp_.file("destination", "old contents");
  off64_t size = -1;
  const BeforeCall copying(Call::copy_file_range, [&] { size = statusOf(destination).st_size; });

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(copying.fired());
  EXPECT_EQ(size, 0);
}

// ---- clearFile ----

TEST_P(ClearFile, RefusesANullPath) {
  EXPECT_FALSE(clearFile(nullptr));
  EXPECT_EQ(trail(), traced(call("clearFile", 0, debug("clearFile: passed a null pointer."))));
}

TEST_P(ClearFile, EmptiesAFileAndKeepsTheRestOfIt) {
  const std::string path = temp_.file("file", "contents");
  const Permissions mode(path, 0604);
  const struct stat64 before = statusOf(path);
  const int open_before = openDescriptors();

  EXPECT_TRUE(clearFile(path.c_str()));

  EXPECT_EQ(trail(), traced(call("clearFile", 1, no("isDirectory"))));
  const struct stat64 after = statusOf(path);
  EXPECT_EQ(after.st_size, 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mode, before.st_mode);
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(ClearFile, MakesAMissingFileWithMode0600LessTheMask) {
  for (const mode_t mask : {022U, 0277U}) {
    SCOPED_TRACE(mask);
    const Umask umask(mask);
    const std::string path = temp_.path("made" + std::to_string(mask));
    EXPECT_TRUE(clearFile(path.c_str()));
    EXPECT_EQ(trail(), traced(call("clearFile", 1, query("isDirectory", 0, ENOENT))));
    EXPECT_EQ(statusOf(path).st_mode, S_IFREG | (0600 & ~mask));
    EXPECT_EQ(statusOf(path).st_size, 0);
    EXPECT_EQ(currentUmask(), mask);
  }
}

TEST_P(ClearFile, LeavesADirectoryAndASocket) {
  const std::string directory = temp_.dir("directory");
  temp_.file("directory/kept", "text");
  makeSocket(temp_.path("socket"));
  for (const std::string& path : {directory, temp_.path("socket")}) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(clearFile(path.c_str()));
    EXPECT_EQ(trail(), traced(call("clearFile", 0, yes("isDirectory"))));
  }
  EXPECT_EQ(contentsOf(directory + "/kept"), "text");
}

TEST_P(ClearFile, SaysWhyTheFileCannotBeOpened) {
  const std::string path = temp_.file("file", "contents");
  const FailingCall opened(Call::open64, EMFILE);
  const FailingCall locked(Call::lockf64, EIO);

  EXPECT_FALSE(clearFile(path.c_str()));

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(),
            traced(call("clearFile", 0, no("isDirectory"),
                        error("clearFile: (2) failed to truncate file. errno=24 - Too many "
                              "open files"))));
  EXPECT_EQ(locked.calls(), 0);
  EXPECT_EQ(contentsOf(path), "contents");
}

TEST_P(ClearFile, FailsForPathsThatNoFileCanHave) {
  const std::pair<std::string, int> cases[] = {
      {"", ENOENT},
      {temp_.path("none/file"), ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(clearFile(path.c_str()));
    EXPECT_EQ(trail(), traced(call("clearFile", 0, query("isDirectory", 0, reason),
                                   error("clearFile: (2) failed to truncate file. errno=" +
                                         std::to_string(reason) + " - " + strerror(reason)))));
  }
}

TEST_P(ClearFile, LeavesWhatMayNotBeWritten) {
  const std::string path = temp_.file("file", "contents");
  const Permissions read_only(path, 0444);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(clearFile(path.c_str()));
              EXPECT_EQ(trail(), traced(call("clearFile", 0, no("isDirectory"),
                                             error("clearFile: (2) failed to truncate file. "
                                                   "errno=13 - Permission denied"))));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(path), "contents");
}

TEST_P(ClearFile, SaysWhyTheFileCannotBeEmptiedAndClosesIt) {
  const std::string existing = temp_.file("file", "contents");
  const std::string made = temp_.path("made");
  const int open_before = openDescriptors();
  for (const std::string& path : {existing, made}) {
    SCOPED_TRACE(path);
    const FailingCall truncation(Call::ftruncate64, EIO);
    const FailingCall lock(Call::lockf64, EIO, 1000);  // counts only

    EXPECT_FALSE(clearFile(path.c_str()));

    ASSERT_TRUE(truncation.fired());
    EXPECT_EQ(trail(),
              traced(call("clearFile", 0,
                          path == made ? query("isDirectory", 0, ENOENT) : no("isDirectory"),
                          error("clearFile: (1) failed to truncate file. errno=5 - "
                                "Input/output error"))));
    EXPECT_EQ(lock.calls(), 2);
    EXPECT_EQ(openDescriptors(), open_before);
  }
  EXPECT_EQ(contentsOf(existing), "contents");
  EXPECT_EQ(contentsOf(made), "");  // made by the open
}

TEST_P(ClearFile, FailsOnAPipeWhichHasNoLength) {
  const std::string path = temp_.path("fifo");
  makeFifo(path);
  const int reader = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  ASSERT_NE(reader, -1);
  EXPECT_FALSE(clearFile(path.c_str()));
  EXPECT_EQ(trail(), traced(call("clearFile", 0, no("isDirectory"),
                                 error("clearFile: (1) failed to truncate file. errno=22 - Invalid "
                                       "argument"))));
  close(reader);
}

TEST_P(ClearFile, AsksForTheLockUntilItHasIt) {
  const std::string path = temp_.file("file", "contents");
  off64_t size_at_last_try = -1;
  const BeforeCall last_try(
      Call::lockf64, [&] { size_at_last_try = statusOf(path).st_size; }, 6);
  const FailingCall lock(Call::lockf64, EDEADLK, 1, 5);

  EXPECT_TRUE(clearFile(path.c_str()));

  ASSERT_TRUE(last_try.fired());
  EXPECT_EQ(lock.calls(), 7);  // the release is one more
  EXPECT_EQ(size_at_last_try, 8);
  EXPECT_EQ(trail(), traced(call("clearFile", 1, no("isDirectory"))));
  EXPECT_EQ(statusOf(path).st_size, 0);
}

TEST_P(ClearFile, DoesNotReportAFailedReleaseOrClose) {
  const std::string path = temp_.file("file", "contents");
  const FailingCall release(Call::lockf64, EIO, 2, 1);
  const FailingCall closed(Call::close, EIO);

  EXPECT_TRUE(clearFile(path.c_str()));

  ASSERT_TRUE(release.fired() && closed.fired());
  EXPECT_EQ(trail(), traced(call("clearFile", 1, no("isDirectory"))));
}

// The lock on the file as another process sees it; F_UNLCK when there is none.
struct flock lockSeenByAnotherProcess(const std::string& path) {
  int answer[2];
  EXPECT_EQ(pipe2(answer, O_CLOEXEC), 0);
  struct flock seen = {};
  const pid_t child = fork();
  if (child == 0) {
    seen.l_type = F_WRLCK;
    const int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
    const bool done = fcntl(descriptor, F_GETLK, &seen) == 0 &&
                      write(answer[1], &seen, sizeof seen) == sizeof seen;
    _exit(done ? 0 : 1);
  }
  close(answer[1]);
  EXPECT_EQ(read(answer[0], &seen, sizeof seen), static_cast<ssize_t>(sizeof seen));
  close(answer[0]);
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  return seen;
}

TEST_P(ClearFile, LocksTheWholeFileWhileItEmptiesIt) {
  const std::string path = temp_.file("file", "contents");
  struct flock seen = {};
  const BeforeCall truncation(Call::ftruncate64, [&] { seen = lockSeenByAnotherProcess(path); });
  struct flock seen_at_close = {};
  const BeforeCall closing(Call::close, [&] { seen_at_close = lockSeenByAnotherProcess(path); });

  EXPECT_TRUE(clearFile(path.c_str()));

  ASSERT_TRUE(truncation.fired() && closing.fired());
  EXPECT_EQ(seen.l_type, F_WRLCK);
  EXPECT_EQ(seen.l_pid, getpid());
  EXPECT_EQ(seen.l_start, 0);
  EXPECT_EQ(seen.l_len, 0);  // without end
  EXPECT_EQ(seen_at_close.l_type, F_UNLCK);
}

TEST_P(ClearFile, OpensForSynchronousWritesOnly) {
  const std::string path = temp_.file("file", "contents");
  int flags = 0;
  const BeforeCall truncation(Call::ftruncate64,
                              [&] { flags = fcntl(descriptorOf(path), F_GETFL); });

  EXPECT_TRUE(clearFile(path.c_str()));

  ASSERT_TRUE(truncation.fired());
  EXPECT_EQ(flags & (O_ACCMODE | O_SYNC | O_APPEND), O_WRONLY | O_DSYNC);
}

TEST_P(ClearFile, WaitsForAnotherProcessToReleaseTheFile) {
  const std::string path = temp_.file("file", "contents");
  int held[2];
  int wanted[2];
  ASSERT_EQ(pipe2(held, O_CLOEXEC), 0);
  ASSERT_EQ(pipe2(wanted, O_CLOEXEC), 0);
  const pid_t holder = fork();
  ASSERT_NE(holder, -1);
  if (holder == 0) {
    char token = 'x';
    const int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
    bool done = lockf64(descriptor, F_LOCK, 0) == 0 && write(held[1], &token, 1) == 1 &&
                read(wanted[0], &token, 1) == 1;
    usleep(100'000);  // time for a lock that is none to let the other one through
    struct stat64 status = {};
    done = done && fstat64(descriptor, &status) == 0 && status.st_size == 8;
    _exit(done ? 0 : 1);
  }
  char token = 'x';
  ASSERT_EQ(read(held[0], &token, 1), 1);
  bool told = false;
  const BeforeCall lock(Call::lockf64, [&] { told = write(wanted[1], &token, 1) == 1; });

  EXPECT_TRUE(clearFile(path.c_str()));

  EXPECT_TRUE(told);
  int status = 0;
  EXPECT_EQ(waitpid(holder, &status, 0), holder);
  EXPECT_EQ(status, 0) << "the file was emptied while another process had it locked";
  EXPECT_EQ(statusOf(path).st_size, 0);
  for (const int descriptor : {held[0], held[1], wanted[0], wanted[1]}) close(descriptor);
}

// ---- readFile ----

struct Free {
  void operator()(char* memory) const { free(memory); }
};
using Buffer = std::unique_ptr<char, Free>;

// What an output holds before a call that must not touch it.
char untouched[] = "untouched";

TEST_P(ReadFile, RefusesANullPath) {
  char* out = untouched;
  EXPECT_FALSE(readFile(nullptr, &out));
  EXPECT_EQ(trail(), traced(call("readFile", 0, debug("readFile: passed a null pointer."))));
  EXPECT_EQ(out, untouched);
}

TEST_P(ReadFile, ReadsEveryByteIntoABufferOfTheCallers) {
  const int open_before = openDescriptors();
  const size_t sizes[] = {1, 7, 4096, 65537, (1 << 20) + 3};
  for (const size_t size : sizes) {
    SCOPED_TRACE(size);
    std::string contents = randomBytes(size);
    contents[size / 2] = '\0';
    const std::string path = temp_.file("file", contents);
    const LiveAllocations live;
    char* out = nullptr;

    EXPECT_TRUE(readFile(path.c_str(), &out));

    if (!sanitizerOwnsMalloc()) {
      EXPECT_EQ(live.blocks(), 1);
    }
    const Buffer buffer(out);
    EXPECT_EQ(trail(), traced(call("readFile", 1, no("isDirectory"))));
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(memcmp(out, contents.data(), size), 0);
  }
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(ReadFile, GivesABufferForAnEmptyFileToo) {
  const std::string path = temp_.file("empty", "");
  char* out = nullptr;
  EXPECT_TRUE(readFile(path.c_str(), &out));
  EXPECT_NE(out, nullptr);
  free(out);
}

TEST_P(ReadFile, FollowsALink) {
  makeLink(temp_.file("target", "text"), temp_.path("link"));
  char* out = nullptr;
  ASSERT_TRUE(readFile(temp_.path("link").c_str(), &out));
  EXPECT_EQ(std::string(out, 4), "text");
  free(out);
}

TEST_P(ReadFile, FailsOnADirectoryAndASocketAndTouchesNothing) {
  makeSocket(temp_.path("socket"));
  for (const std::string& path : {temp_.path(), temp_.path("socket")}) {
    SCOPED_TRACE(path);
    char* out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));
    EXPECT_EQ(trail(), traced(call("readFile", 0, yes("isDirectory"))));
    EXPECT_EQ(out, untouched);
  }
}

TEST_P(ReadFile, FailsWithoutAMessageWhenTheFileCannotBeOpened) {
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    char* out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));
    EXPECT_EQ(trail(), traced(call("readFile", 0, query("isDirectory", 0, reason))));
    EXPECT_EQ(out, untouched);
  }
  const FailingCall opened(Call::fopen64, EMFILE);
  char* out = untouched;
  EXPECT_FALSE(readFile(temp_.path("file").c_str(), &out));
  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
  EXPECT_EQ(out, untouched);
}

TEST_P(ReadFile, FailsWhereReadingIsRefused) {
  const std::string path = temp_.file("file", "text");
  const Permissions unreadable(path, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              char* out = untouched;
              EXPECT_FALSE(readFile(path.c_str(), &out));
              EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
              EXPECT_EQ(out, untouched);
              return 0;
            }),
            0);
}

TEST_P(ReadFile, WithoutMemoryGivesNullAndLeavesTheStreamOpen) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const int open_before = openDescriptors();
  const LiveAllocations live;
  const FailingCall allocation(Call::calloc, ENOMEM);
  char* out = untouched;

  EXPECT_FALSE(readFile(path.c_str(), &out));

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
  EXPECT_EQ(out, nullptr);
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(openDescriptors(), open_before + 1);
  EXPECT_TRUE(isOpenHere(path));
}

TEST_P(ReadFile, TakesTheSizeAsASigned32BitNumber) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "beginning");
  ASSERT_EQ(truncate(path.c_str(), (off_t{1} << 32) + 9), 0);
  char* out = nullptr;
  ASSERT_TRUE(readFile(path.c_str(), &out));
  EXPECT_EQ(std::string(out, 9), "beginning");
  free(out);

  ASSERT_EQ(truncate(path.c_str(), off_t{1} << 31), 0);
  out = untouched;
  EXPECT_FALSE(readFile(path.c_str(), &out));  // a negative size is more than there is memory
  EXPECT_EQ(out, nullptr);
}

TEST_P(ReadFile, OfAPipeFindsNoSizeAndNoMemoryForIt) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.path("fifo");
  makeFifo(path);
  PipeWriter writer(path, "text");
  char* out = untouched;
  EXPECT_FALSE(readFile(path.c_str(), &out));
  EXPECT_TRUE(writer.allWasTaken());
  EXPECT_EQ(out, nullptr);
}

TEST_P(ReadFile, ReadsAsZerosWhatCannotBeRead) {
  const std::string path = temp_.file("file", "text");
  const FailingCall reading(Call::fread, EIO);
  char* out = nullptr;

  ASSERT_TRUE(readFile(path.c_str(), &out));

  ASSERT_TRUE(reading.fired());
  EXPECT_EQ(std::string(out, 4), std::string(4, '\0'));
  free(out);
}

TEST_P(ReadFile, IgnoresAFailedClose) {
  const std::string path = temp_.file("file", "text");
  const FailingCall closing(Call::fclose, EIO);
  char* out = nullptr;
  ASSERT_TRUE(readFile(path.c_str(), &out));
  ASSERT_TRUE(closing.fired());
  EXPECT_EQ(std::string(out, 4), "text");
  free(out);
}

TEST_P(ReadFile, DiesOfANullOutPointer) {
  const std::string path = temp_.file("file", "text");
  char** volatile none = nullptr;
  EXPECT_DEATH((void)readFile(path.c_str(), none), "");
}

// ---- getFileNameFromPath ----

TEST_P(GetFileNameFromPath, RefusesANullPath) {
  EXPECT_EQ(getFileNameFromPath(nullptr), nullptr);
  EXPECT_EQ(trail(), traced(call("getFileNameFromPath", 0,
                                 error("Error - getFileNameFromPath: path is NULL"))));
}

TEST_P(GetFileNameFromPath, GivesACopyOfWhatFollowsTheLastSeparator) {
  const std::string long_name(100'000, 'n');
  const std::pair<std::string, std::string> cases[] = {
      {"a/b/c", "c"},     {"C:\\dir\\f", "f"}, {"plain", "plain"},
      {"", ""},           {"dir/", ""},        {"dir\\", ""},
      {"/", ""},          {"\\", ""},          {"/root", "root"},
      {"a/b\\c", "b\\c"}, {"a\\b/c", "c"},     {"a\\b/", ""},
      {"a//b", "b"},      {"a/b ", "b "},      {"d/" + long_name, long_name},
  };
  for (const auto& [path, name] : cases) {
    SCOPED_TRACE(path.substr(0, 100));
    const LiveAllocations live;
    const Buffer result(getFileNameFromPath(path.c_str()));
    EXPECT_EQ(trail(), traced(call("getFileNameFromPath", 0)));
    ASSERT_NE(result, nullptr);
    EXPECT_EQ(result.get(), name);
    EXPECT_NE(result.get(), path.c_str());
    if (!sanitizerOwnsMalloc()) {
      EXPECT_EQ(live.blocks(), 1);
    }
  }
}

TEST_P(GetFileNameFromPath, GivesNullWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  for (const char* path : {"a/b", "a\\b", "plain"}) {
    const FailingCall copy(Call::strdup, ENOMEM);
    EXPECT_EQ(getFileNameFromPath(path), nullptr);
    ASSERT_TRUE(copy.fired());
    EXPECT_EQ(trail(), traced(call("getFileNameFromPath", 0)));
  }
}

// ---- getFileOwnersAndPermissions ----

// The outputs of one call, as they are before it.
struct Owners {
  char* owner = untouched;
  char* group = untouched;
  unsigned int mode = 4711;

  bool get(const std::string& path) {
    return getFileOwnersAndPermissions(path.c_str(), &owner, &group, &mode);
  }
  void expectUntouched() const {
    EXPECT_EQ(owner, untouched);
    EXPECT_EQ(group, untouched);
    EXPECT_EQ(mode, 4711U);
  }
  ~Owners() {
    if (owner != untouched) free(owner);
    if (group != untouched) free(group);
  }
};

Trail ownersMessage(const std::string& text) {
  return debug("getFileOwnersAndPermissions: " + text);
}
// A look-up that needs `size` bytes, from the first size on.
Trail lookUp(const std::string& function, int size) {
  Trail all;
  for (int tried = 2048; tried < size; tried *= 2) {
    all = joined(all, ownersMessage(function + " invocation returned ERANGE with allocation at " +
                                    std::to_string(tried)));
  }
  return joined(all, ownersMessage(function + " invocation SUCCESSFUL with allocation at " +
                                   std::to_string(size)));
}
// One that never gets a buffer that is large enough.
Trail lookUpInVain(const std::string& function) {
  Trail all;
  for (int tried = 2048; tried <= 134217728; tried *= 2) {
    all = joined(all, ownersMessage(function + " invocation returned ERANGE with allocation at " +
                                    std::to_string(tried)));
  }
  return joined(all, ownersMessage(function + " terminating with next allocation at 268435456"));
}
template <typename... Inner>
Trail ownersCall(long code, const Inner&... inner) {
  return call("getFileOwnersAndPermissions", code, inner...);
}

TEST_P(GetFileOwners, RefusesANullPathOrName) {
  const std::string path = temp_.file("file", "text");
  const Trail refused = traced(ownersCall(0, ownersMessage("passed a null pointer.")));
  Owners owners;

  EXPECT_FALSE(getFileOwnersAndPermissions(nullptr, &owners.owner, &owners.group, &owners.mode));
  EXPECT_EQ(trail(), refused);
  EXPECT_FALSE(getFileOwnersAndPermissions(path.c_str(), nullptr, &owners.group, &owners.mode));
  EXPECT_EQ(trail(), refused);
  EXPECT_FALSE(getFileOwnersAndPermissions(path.c_str(), &owners.owner, nullptr, &owners.mode));
  EXPECT_EQ(trail(), refused);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, DiesOfANullMode) {
  const std::string path = temp_.file("file", "text");
  Owners owners;
  unsigned int* volatile none = nullptr;
  EXPECT_DEATH((void)getFileOwnersAndPermissions(path.c_str(), &owners.owner, &owners.group, none),
               "");
}

TEST_P(GetFileOwners, GivesTheNamesAndTheWholeModeWord) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  (void)trail();
  const LiveAllocations live;
  Owners owners;

  ASSERT_TRUE(owners.get(path));

  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 2);  // the names, and no buffer
  }
  EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048))));
  EXPECT_STREQ(owners.owner, getpwuid(getuid())->pw_name);
  EXPECT_STREQ(owners.group, getgrgid(ownGroup())->gr_name);
  EXPECT_EQ(owners.mode, 0100644U);
}

TEST_P(GetFileOwners, TellsTheOwnerFromTheGroup) {
  REQUIRE_ROOT("to give a file away");
  const std::string path = temp_.file("file", "text");
  ASSERT_EQ(chown(path.c_str(), kNobody, 1), 0);
  ASSERT_EQ(chmod(path.c_str(), 06755), 0);
  Owners owners;
  ASSERT_TRUE(owners.get(path));
  EXPECT_STREQ(owners.owner, getpwuid(kNobody)->pw_name);
  EXPECT_STREQ(owners.group, getgrgid(1)->gr_name);
  EXPECT_EQ(owners.mode, 0106755U);
}

TEST_P(GetFileOwners, KeepsTheTypeBitsOfWhatIsNoFile) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0600));  // for an own group that exists
  const std::string directory = temp_.dir("directory");
  makeFifo(temp_.path("fifo"));
  makeLink(path, temp_.path("link"));
  for (const std::string& each : {directory, temp_.path("fifo")}) {
    ASSERT_EQ(chown(each.c_str(), getuid(), ownGroup()), 0);
    ASSERT_EQ(chmod(each.c_str(), 0710), 0);
  }
  const std::pair<std::string, unsigned int> cases[] = {
      {directory, S_IFDIR | 0710},
      {temp_.path("fifo"), S_IFIFO | 0710},
      {temp_.path("link"), S_IFREG | 0600},  // the target's
  };
  for (const auto& [each, mode] : cases) {
    SCOPED_TRACE(each);
    Owners owners;
    ASSERT_TRUE(owners.get(each));
    EXPECT_EQ(owners.mode, mode);
  }
}

TEST_P(GetFileOwners, SaysWhyThePathCannotBeExamined) {
  makeLink(temp_.path("nothing"), temp_.path("dangling"));
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {temp_.path("dangling"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    EXPECT_EQ(trail(),
              traced(ownersCall(0, ownersMessage("stat() - errno=" + std::to_string(reason)))));
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, WithoutMemoryForABufferFreesTheOther) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const char* const buffers[] = {"password", "group"};
  for (const int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    const LiveAllocations live;
    const FailingCall allocation(Call::malloc, ENOMEM, nth);
    Owners owners;

    EXPECT_FALSE(owners.get(path));

    ASSERT_TRUE(allocation.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, ownersMessage("the malloc for the sysconf " +
                                                          std::string(buffers[nth - 1]) +
                                                          " buffer size maximum failed - "
                                                          "value=2048"))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, ReportsALookUpThatFails) {
  const std::string path = temp_.file("file", "text");
  for (const int reason : {EIO, ENOENT, EINTR, EMFILE}) {
    SCOPED_TRACE(reason);
    const LiveAllocations live;
    const std::string text = " invocation returned non-zero return code=" + std::to_string(reason);
    {
      const FailingCall user(Call::getpwuid_r, reason);
      const FailingCall group(Call::getgrgid_r, EIO, 1000);  // counts only
      Owners owners;
      EXPECT_FALSE(owners.get(path));
      ASSERT_TRUE(user.fired());
      EXPECT_EQ(trail(), traced(ownersCall(0, ownersMessage("getpwuid_r" + text))));
      EXPECT_EQ(group.calls(), 0);
      owners.expectUntouched();
    }
    const FailingCall group(Call::getgrgid_r, reason);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(group.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, lookUp("getpwuid_r", 2048),
                                         ownersMessage("getgrgid_r" + text))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, GivesUpWhen128MiBAreNotEnough) {
  const std::string path = temp_.file("file", "text");
  const LiveAllocations live;
  {
    const FailingCall user(Call::getpwuid_r, ERANGE, 1, 100);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    EXPECT_EQ(user.calls(), 17);
    EXPECT_EQ(trail(), traced(ownersCall(0, lookUpInVain("getpwuid_r"))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 100);
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  EXPECT_EQ(group.calls(), 17);
  EXPECT_EQ(trail(), traced(ownersCall(0, lookUp("getpwuid_r", 2048), lookUpInVain("getgrgid_r"))));
  EXPECT_EQ(live.blocks(), 0);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, SucceedsWith128MiB) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  (void)trail();
  const LiveAllocations live;
  const FailingCall user(Call::getpwuid_r, ERANGE, 1, 16);
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 16);
  Owners owners;

  EXPECT_TRUE(owners.get(path));

  EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 134217728),
                                       lookUp("getgrgid_r", 134217728))));
  EXPECT_STREQ(owners.owner, getpwuid(getuid())->pw_name);
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 2);
  }
}

TEST_P(GetFileOwners, LosesTheOldBufferWhenItCannotGrow) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const Trail too_small =
      ownersMessage("getpwuid_r invocation returned ERANGE with allocation at 2048");
  {
    const LiveAllocations live;
    const FailingCall user(Call::getpwuid_r, ERANGE);
    const FailingCall growth(Call::realloc, ENOMEM);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(growth.fired());
    EXPECT_EQ(trail(),
              traced(ownersCall(0, too_small,
                                ownersMessage("the realloc for the passwordbuffer size amount - "
                                              "value=4096"))));
    EXPECT_EQ(live.blocks(), 1);
    owners.expectUntouched();
  }
  const LiveAllocations live;
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 2);
  const FailingCall growth(Call::realloc, ENOMEM, 2);
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  ASSERT_TRUE(growth.fired());
  EXPECT_EQ(trail(),
            traced(ownersCall(
                0, lookUp("getpwuid_r", 2048),
                ownersMessage("getgrgid_r invocation returned ERANGE with allocation at 2048"),
                ownersMessage("getgrgid_r invocation returned ERANGE with allocation at 4096"),
                ownersMessage("the realloc for the group buffer size amount - value=8192"))));
  EXPECT_EQ(live.blocks(), 1);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, FailsWhenNoAccountIsFoundTheGroupFirst) {
  const std::string path = temp_.file("file", "text");
  const Trail looked_up = joined(lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048));
  const LiveAllocations live;
  // Error 0: the look-up answers success and finds nothing.
  const FailingCall user(Call::getpwuid_r, 0, 1, 2);
  {
    const FailingCall group(Call::getgrgid_r, 0);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(group.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, looked_up,
                                         ownersMessage("the value of gidInfo.gr_name returned "
                                                       "by getgrgid_r is NULL"))));
    owners.expectUntouched();
  }
  if (getgrgid(statusOf(path).st_gid) == nullptr) GTEST_SKIP() << "the own group has no account";
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  ASSERT_TRUE(user.fired());
  EXPECT_EQ(trail(), traced(ownersCall(0, looked_up,
                                       ownersMessage("the value of uidInfo.pw_name returned "
                                                     "by getgrgid_r is NULL"))));
  EXPECT_EQ(live.blocks(), 0);
  owners.expectUntouched();
}

constexpr uid_t kUnused = 3'999'999'999U;  // no account has this id

// A private /etc whose account databases are files, with these lines at their ends.
int withAccounts(const std::string& users, const std::string& groups,
                 const std::function<int()>& body) {
  return withPrivateEtc([&] {
    std::ofstream("/etc/passwd", std::ios::app) << users;
    std::ofstream("/etc/group", std::ios::app) << groups;
    writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\n");
    return body();
  });
}

std::string manyMembers(const std::string& group, int members) {
  std::string line = group + ":member0";
  for (int member = 1; member < members; ++member) line += ",member" + std::to_string(member);
  return line + "\n";
}

TEST_P(GetFileOwners, FailsForIdsWithoutAnAccountAmongManyOthers) {
  REQUIRE_ROOT("for accounts of its own");
  const std::string path = temp_.file("file", "text");
  const Trail looked_up = joined(lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048));
  const Trail no_user =
      ownersMessage("the value of uidInfo.pw_name returned by getgrgid_r is NULL");
  const Trail no_group =
      ownersMessage("the value of gidInfo.gr_name returned by getgrgid_r is NULL");
  EXPECT_EQ(withAccounts("last:x:60001:60001::/:/bin/sh\n", "last:x:60001:\n",
                         [&] {
                           const struct {
                             uid_t owner;
                             gid_t group;
                             const Trail& message;
                           } cases[] = {{kUnused, 0, no_user},
                                        {0, kUnused, no_group},
                                        {kUnused, kUnused, no_group}};
                           for (const auto& each : cases) {
                             SCOPED_TRACE(each.owner);
                             EXPECT_EQ(chown(path.c_str(), each.owner, each.group), 0);
                             Owners owners;
                             EXPECT_FALSE(owners.get(path));
                             EXPECT_EQ(trail(), traced(ownersCall(0, looked_up, each.message)));
                             owners.expectUntouched();
                           }
                           return 0;
                         }),
            0);
}

TEST_P(GetFileOwners, GrowsItsBuffersForLargeAccounts) {
  REQUIRE_ROOT("for accounts of its own");
  const std::string path = temp_.file("file", "text");
  ASSERT_EQ(chown(path.c_str(), 60001, 60002), 0);
  EXPECT_EQ(withAccounts("wordy:x:60001:60002:" + std::string(3000, 'c') + ":/:/bin/sh\n",
                         manyMembers("crowd:x:60002", 5000),
                         [&] {
                           // What the group needs, found with the C library alone.
                           int size = 2048;
                           struct group record = {};
                           struct group* found = nullptr;
                           std::string buffer;
                           do {
                             size *= 2;
                             buffer.resize(static_cast<size_t>(size));
                           } while (getgrgid_r(60002, &record, buffer.data(), buffer.size(),
                                               &found) == ERANGE);
                           EXPECT_GT(size, 32768);

                           const LiveAllocations live;
                           Owners owners;
                           EXPECT_TRUE(owners.get(path));
                           if (!sanitizerOwnsMalloc()) {
                             EXPECT_EQ(live.blocks(), 2);
                           }
                           EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 4096),
                                                                lookUp("getgrgid_r", size))));
                           EXPECT_STREQ(owners.owner, "wordy");
                           EXPECT_STREQ(owners.group, "crowd");
                           return 0;
                         }),
            0);
}

TEST_P(GetFileOwners, DoesNotNoticeANameThatCannotBeCopied) {
  REQUIRE_OWN_MALLOC();
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  for (const int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    const FailingCall copy(Call::strdup, ENOMEM, nth);
    Owners owners;
    EXPECT_TRUE(owners.get(path));
    ASSERT_TRUE(copy.fired());
    // The group is copied first.
    EXPECT_EQ(owners.group == nullptr, nth == 1);
    EXPECT_EQ(owners.owner == nullptr, nth == 2);
    EXPECT_EQ(owners.mode, 0100644U);
  }
}

// ---- The parts of the trace mask ----

TEST(FileTracing, ExitRecordsOfFailuresAloneStillMarkEveryExit) {
  const TempDir temp;
  const std::string missing = temp.path("missing");
  const Records records(kExitError33);
  (void)checkFilePerms(missing.c_str());
  EXPECT_THAT(records.trail(),
              ElementsAre("< doesFileExist 0", "<! canAccessFile 1", "<! checkFilePerms 32"));
}

TEST(FileTracing, EntriesAndExitsAloneHaveNoMessages) {
  const TempDir temp;
  const Records records(kEntryExit33);
  (void)canAccessFile(temp.path("missing").c_str());
  EXPECT_THAT(records.trail(), ElementsAre("> canAccessFile", "< canAccessFile 1"));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(FileTracing, MessagesAloneHaveNoEntriesAndExits) {
  const TempDir temp;
  const Records records(kDebug);
  EXPECT_EQ(checkFilePerms(temp.path().c_str()), OSUTILS_CONSTRAINT_VIOLATION);
  EXPECT_THAT(records.trail(),
              ElementsAre("E checkFilePerms - " + temp.path() + " is a directory.\n"));
}

TEST(FileTracing, TheOtherTraceClassBringsNothing) {
  const TempDir temp;
  const Records records(kEntryExit43 | kExitError43);
  (void)checkFilePerms(temp.path().c_str());
  EXPECT_THAT(records.trail(), IsEmpty());
}

}  // namespace
