// Directories, links and free space, and path answers that are the same on every platform.

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <limits.h>
#include <pwd.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <iterator>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "calls.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

namespace {

constexpr long kMiB = 1 << 20;

// ---- What calls leave in the trace ----

Trail debug(const std::string& text) { return {"D " + text}; }
Trail error(const std::string& text) { return {"E " + text}; }

// A query whose look at the path failed.
Trail query(const std::string& name, long code, int error_number) {
  return call(name, code, debug(name + ": stat() - errno=" + std::to_string(error_number) + "\n"));
}
// Both questions about a path that does not exist.
Trail missing() {
  return joined(query("doesFileExist", 0, ENOENT), query("canAccessFile", 1, ENOENT));
}
// What is asked about a directory that is to be removed.
Trail isThere() { return joined(yes("doesFileExist"), yes("isDirectory")); }
Trail isFileThere() { return joined(yes("doesFileExist"), no("isDirectory")); }
Trail removed() { return call("deleteDirectory", 1, isThere()); }

// The messages about the account of this process.
Trail ownAccount() {
  const passwd* const user = getpwuid(getuid());
  const std::string gid = std::to_string(user == nullptr ? 0 : user->pw_gid);
  return joined(debug("vra_get_uid: name=NULL uid=" + std::to_string(getuid()) + "\n"),
                debug("vra_get_usr_gid: name=NULL gid=" + gid + "\n"),
                debug("vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid + "\n"));
}

Trail forced(const std::string& path) {
  return debug("deleteDirForcefully: command = 'rm -rf " + path + "'.\n");
}
Trail forcedInVain(int status) {
  return debug("deleteDirForcefully: Failed to delete dir with rc='" + std::to_string(status) +
               "'");
}

// ---- The world around a test ----

// The string, freed.
std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

class Umask {
 public:
  explicit Umask(mode_t mask) : before_(umask(mask)) {}
  ~Umask() { umask(before_); }
  Umask(const Umask&) = delete;
  Umask& operator=(const Umask&) = delete;

 private:
  mode_t before_;
};

// Runs the body in a child process, where it may change the working directory.
void apart(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

// Runs the body in a child process that permission bits stop: they do not stop root.
void asOrdinaryUser(const std::function<void()>& body) {
  if (geteuid() != 0) return apart(body);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     body();
                     return 0;
                   }),
            0);
}

// What commands write to the standard error of this process is not shown any more.
void silence() {
  const int nowhere = open("/dev/null", O_WRONLY | O_CLOEXEC);
  ASSERT_NE(nowhere, -1);
  ASSERT_EQ(dup2(nowhere, STDERR_FILENO), STDERR_FILENO);
  close(nowhere);
}

void openToAll(const std::string& path) { EXPECT_EQ(chmod(path.c_str(), 0777), 0) << path; }

void enter(const std::string& path) { ASSERT_EQ(chdir(path.c_str()), 0) << path; }

void makeDirectory(const std::string& path) { ASSERT_EQ(mkdir(path.c_str(), 0755), 0) << path; }

void makeLink(const std::string& target, const std::string& name) {
  EXPECT_EQ(symlink(target.c_str(), name.c_str()), 0) << name;
}

std::string targetOf(const std::string& link) {
  std::error_code failure;
  const std::filesystem::path target = std::filesystem::read_symlink(link, failure);
  return failure ? "(no link)" : target.string();
}

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

struct stat statusOf(const std::string& path) {
  struct stat status = {};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return status;
}

// The names in a directory.
std::vector<std::string> namesIn(const std::string& path) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(path)) {
    names.push_back(entry.path().filename().string());
  }
  return names;
}

// Each test of this kind runs with tracing on, and again with it off.
class Directories : public testing::TestWithParam<bool> {
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
  class suite : public Directories {};                                               \
  INSTANTIATE_TEST_SUITE_P(Tracing, suite, testing::Bool(), [](const auto& tested) { \
    return std::string(tested.param ? "On" : "Off");                                 \
  })

TRACED_AND_NOT(FixedAnswers);
TRACED_AND_NOT(CurrentWorkingDirectory);
TRACED_AND_NOT(CreateDirectory);
TRACED_AND_NOT(DeleteDirectory);
TRACED_AND_NOT(DeleteDirForcefully);
TRACED_AND_NOT(CreateSymLink);
TRACED_AND_NOT(RemoveSymLink);
TRACED_AND_NOT(IsEnoughDriveSpace);
TRACED_AND_NOT(TrimLastDirectory);

// ---- getTempDir, getSystemDrive, getLocalDrives, getShortname ----

TEST_P(FixedAnswers, NameTheTemporaryDirectoryAndTheRoot) {
  EXPECT_EQ(taken(getTempDir()), "/tmp");
  EXPECT_EQ(trail(), traced(no("getTempDir")));
  EXPECT_EQ(taken(getSystemDrive()), "/");
  EXPECT_EQ(trail(), traced(no("getSystemDrive")));
}

TEST_P(FixedAnswers, DoNotFollowTheEnvironment) {
  apart([] {
    ASSERT_EQ(setenv("TMPDIR", "/var/tmp", 1), 0);
    EXPECT_EQ(taken(getTempDir()), "/tmp");
  });
}

TEST_P(FixedAnswers, SayThatThereAreNoDrives) {
  EXPECT_EQ(getLocalDrives(), 0);
  EXPECT_EQ(trail(),
            traced(call("getLocalDrives", 0,
                        debug("getLocalDrives: function not implemented on UNIX platforms.\n"))));
}

TEST_P(FixedAnswers, CopyANameForItsShortOne) {
  const std::string name = "/a name/with \\ all\tof it/";
  char* const copy = getShortname(name.c_str());
  EXPECT_NE(copy, name.c_str());
  EXPECT_EQ(taken(copy), name);
  EXPECT_EQ(trail(), traced(no("getShortname")));
  EXPECT_EQ(taken(getShortname("")), "");
}

TEST_P(FixedAnswers, RefuseANullName) {
  EXPECT_EQ(getShortname(nullptr), nullptr);
  EXPECT_EQ(trail(),
            traced(call("getShortname", 0, debug("getShortname: passed a null pointer.\n"))));
}

TEST_P(FixedAnswers, AreNewStrings) {
  REQUIRE_OWN_MALLOC();
  const std::function<char*()> asked[] = {getTempDir, getSystemDrive,
                                          [] { return getShortname("name"); }};
  for (const auto& ask : asked) {
    const LiveAllocations live;
    char* const first = ask();
    char* const second = ask();
    EXPECT_NE(first, second);
    EXPECT_EQ(live.blocks(), 2);
    free(first);
    free(second);
    EXPECT_EQ(live.blocks(), 0);
  }
}

TEST_P(FixedAnswers, AreNullWithoutMemory) {
  REQUIRE_OWN_MALLOC();
  const auto without_memory = [](const std::function<char*()>& ask) {
    FailingCall copy(Call::strdup, ENOMEM);
    char* const answer = ask();
    copy.disarm();
    EXPECT_TRUE(copy.fired());
    return answer;
  };

  EXPECT_EQ(without_memory(getTempDir), nullptr);
  EXPECT_EQ(without_memory(getSystemDrive), nullptr);
  EXPECT_EQ(without_memory([] { return getShortname("name"); }), nullptr);

  EXPECT_EQ(trail(), traced(no("getTempDir"), no("getSystemDrive"), no("getShortname")));
}

// ---- getCurrentWorkingDirectory ----

TEST_P(CurrentWorkingDirectory, IsWhereTheProcessIs) {
  const std::string place = std::filesystem::canonical(temp_.dir("a place")).string();
  makeLink(place, temp_.path("link"));
  apart([&] {
    enter(temp_.path("link"));
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), place);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
    enter("/");
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), "/");
  });
}

TEST_P(CurrentWorkingDirectory, IsANewString) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  char* const path = getCurrentWorkingDirectory();
  EXPECT_EQ(live.blocks(), 1);
  free(path);
  EXPECT_EQ(live.blocks(), 0);
}

TEST_P(CurrentWorkingDirectory, IsNullWithoutAWordWhenTheSystemDoesNotTell) {
  const FailingCall asked(Call::getcwd, EACCES);
  EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
  ASSERT_TRUE(asked.fired());
  EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
}

TEST_P(CurrentWorkingDirectory, IsNullWhenItWasRemoved) {
  const std::string place = temp_.dir("place");
  apart([&] {
    enter(place);
    ASSERT_EQ(rmdir(place.c_str()), 0);
    EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
  });
}

// Makes directories below one another from `path` on, and enters them, until the path of the last
// one has `length` bytes. Returns that path.
std::string enterDeep(std::string path, size_t length) {
  enter(path);
  while (path.size() < length) {
    const size_t left = length - path.size();
    // A slash and a name: one byte alone would be a slash without a name.
    const size_t step = left <= 200 ? left : left == 201 ? 100 : 200;
    const std::string name(step - 1, 'd');
    if (mkdir(name.c_str(), 0755) != 0 || chdir(name.c_str()) != 0) {
      ADD_FAILURE() << strerror(errno);
      break;
    }
    path += "/" + name;
  }
  return path;
}

TEST_P(CurrentWorkingDirectory, MayHave8191BytesAndNoMore) {
  const std::string place = std::filesystem::canonical(temp_.path()).string();
  apart([&] {
    const std::string path = enterDeep(place, 8191);
    EXPECT_EQ(taken(getCurrentWorkingDirectory()), path);
  });
  const std::string other = std::filesystem::canonical(temp_.dir("other")).string();
  apart([&] {
    EXPECT_EQ(enterDeep(other, 8192).size(), 8192U);
    records_.clear();
    EXPECT_EQ(getCurrentWorkingDirectory(), nullptr);
    EXPECT_EQ(trail(), traced(no("getCurrentWorkingDirectory")));
  });
}

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
  makeSocket(temp_.path("socket"));  // its type has the bit of a directory

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

// ---- deleteDirForcefully: what is run ----

TEST_P(DeleteDirForcefully, RefusesANullPath) {
  const FakeSystem shell;
  EXPECT_FALSE(deleteDirForcefully(nullptr));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0,
                                 debug("deleteDirForcefully: passed a null pointer.\n"))));
  EXPECT_THAT(shell.commands(), IsEmpty());
}

TEST_P(DeleteDirForcefully, RunsOneCommandThatItLogsBefore) {
  std::string path = temp_.dir("directory");
  const FakeSystem shell;
  Trail before;
  const BeforeCall run(Call::system, [&] { before = records_.trail(); });

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(run.fired());
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(before, traced(Trail{"> deleteDirForcefully"}, isThere(), forced(path)));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_TRUE(pathExists(path)) << "nothing but the command removes it";
}

TEST_P(DeleteDirForcefully, ShowsTheStatusAsItComes) {
  std::string path = temp_.dir("directory");
  for (const int status : {1, 9, 256, 32512, 65280, -1}) {
    SCOPED_TRACE(status);
    const FakeSystem shell(status);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), forced(path),
                                   forcedInVain(status))));
  }
}

TEST_P(DeleteDirForcefully, FailsWhenNoShellCanBeStarted) {
  std::string path = temp_.dir("directory");
  const FailingCall shell(Call::system, EAGAIN);

  EXPECT_FALSE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(shell.fired());
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(-1))));
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, FreesTheCommandWhateverItsStatus) {
  REQUIRE_OWN_MALLOC();
  std::string path = temp_.dir("directory");
  for (const int status : {0, 256}) {
    const FakeSystem shell(status);
    const LiveAllocations live;
    EXPECT_EQ(deleteDirForcefully(path.data()), status == 0);
    EXPECT_EQ(live.blocks(), 0);
  }
}

TEST_P(DeleteDirForcefully, RefusesEachMetacharacterBeforeAnythingRuns) {
  constexpr char kRefused[] = "&;`'\"|*?~<>^()[]{}$\n\r\\";
  static_assert(sizeof kRefused - 1 == 22);
  const FakeSystem shell;
  const FailingCall print(Call::vra_asprintf, 0, kNever);
  const Trail refused =
      call("deleteDirForcefully", 0, debug("deleteDirForcefully: passed in a metacharacter.\n"));

  for (const char character : std::string(kRefused)) {
    const std::string one(1, character);
    for (const std::string& name : {one, one + "end", "start" + one, "be" + one + "tween"}) {
      SCOPED_TRACE(name);
      std::string path = temp_.dir(name);
      EXPECT_FALSE(deleteDirForcefully(path.data()));
      EXPECT_EQ(trail(), traced(refused));
      EXPECT_TRUE(std::filesystem::is_directory(path));

      std::string below = temp_.dir(name + "/plain");
      EXPECT_FALSE(deleteDirForcefully(below.data()));
      EXPECT_EQ(trail(), traced(refused));
      EXPECT_TRUE(std::filesystem::is_directory(below));

      std::string absent = temp_.path("absent" + one);
      EXPECT_FALSE(deleteDirForcefully(absent.data()));
      EXPECT_EQ(trail(), traced(refused));
    }
  }

  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_EQ(print.calls(), 0);
}

TEST_P(DeleteDirForcefully, TakesEveryOtherCharacter) {
  for (int character = 1; character < 256; ++character) {
    const char one = static_cast<char>(character);
    if (strchr("&;`'\"|*?~<>^()[]{}$\n\r\\/", one) != nullptr) continue;
    SCOPED_TRACE(character);
    std::string path = temp_.dir(std::string("x") + one + "x");
    const FakeSystem shell;
    EXPECT_TRUE(deleteDirForcefully(path.data()));
    EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  }
}

TEST_P(DeleteDirForcefully, OfAFileOrNothingIsAFailureWithoutAWord) {
  std::string file = temp_.file("file", "text");
  std::string absent = temp_.path("absent");
  char empty[] = "";
  const FakeSystem shell;

  EXPECT_FALSE(deleteDirForcefully(file.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isFileThere())));
  EXPECT_FALSE(deleteDirForcefully(absent.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, ENOENT))));
  EXPECT_FALSE(deleteDirForcefully(empty));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, ENOENT))));

  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, WherePermissionsHideThePathRunsNothing) {
  const std::string closed = temp_.dir("closed");
  std::string path = temp_.dir("closed/directory");
  ASSERT_EQ(chmod(closed.c_str(), 0000), 0);
  asOrdinaryUser([&] {
    const FakeSystem shell;
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, query("doesFileExist", 0, EACCES))));
    EXPECT_THAT(shell.commands(), IsEmpty());
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, WithoutACommandGoesOnToTheShellAllTheSame) {
  std::string path = temp_.dir("directory");
  const Trail said = joined(debug("deleteDirForcefully: vra_asprintf failed.\n"),
                            debug("deleteDirForcefully: command = '(null)'.\n"));
  {
    const FailingCall print(Call::vra_asprintf, ENOMEM);
    const FakeSystem shell(1);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    ASSERT_TRUE(print.fired());
    EXPECT_THAT(shell.commands(), ElementsAre(std::nullopt));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), said, forcedInVain(1))));
  }
  {
    const FailingCall print(Call::vra_asprintf, ENOMEM);
    const FakeSystem shell(0);
    EXPECT_FALSE(deleteDirForcefully(path.data())) << "0 says that there is no shell";
    EXPECT_THAT(shell.commands(), ElementsAre(std::nullopt));
    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), said, forcedInVain(0))));
  }
}

TEST_P(DeleteDirForcefully, WithoutACommandFailsWhereThereIsAShell) {
  std::string path = temp_.dir("directory");
  const FailingCall print(Call::vra_asprintf, ENOMEM);

  EXPECT_FALSE(deleteDirForcefully(path.data()));

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 0, isThere(),
                        debug("deleteDirForcefully: vra_asprintf failed.\n"),
                        debug("deleteDirForcefully: command = '(null)'.\n"), forcedInVain(1))));
  EXPECT_TRUE(pathExists(path));
}

TEST_P(DeleteDirForcefully, TakesTheCommandThatAFailedPrintLeft) {
  std::string path = temp_.dir("directory");
  const OddPrint print(-1);
  const FakeSystem shell;
  const LiveAllocations live;

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(trail(),
            traced(call("deleteDirForcefully", 1, isThere(),
                        debug("deleteDirForcefully: vra_asprintf failed.\n"), forced(path))));
}

TEST_P(DeleteDirForcefully, TakesAPrintThatAnswersAnotherNegativeNumber) {
  std::string path = temp_.dir("directory");
  const OddPrint print(-2);
  const FakeSystem shell;
  const LiveAllocations live;

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
}

// ---- deleteDirForcefully: what the shell makes of it ----

TEST_P(DeleteDirForcefully, RemovesAnEmptyDirectory) {
  std::string path = temp_.dir("directory");
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, RemovesASocket) {
  std::string path = temp_.path("socket");
  makeSocket(path);  // its type has the bit of a directory

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
  EXPECT_FALSE(pathExists(path));
}

// Then nobody learns how the shell ended.
TEST_P(DeleteDirForcefully, RemovesTheTreeButFailsWhereTheProcessIgnoresItsChildren) {
  std::string path = temp_.dir("tree");
  temp_.file("tree/file", "text");
  apart([&] {
    signal(SIGCHLD, SIG_IGN);
    EXPECT_FALSE(deleteDirForcefully(path.data()));
    signal(SIGCHLD, SIG_DFL);  // for the end of this process
    EXPECT_EQ(trail(),
              traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(-1))));
  });
  EXPECT_FALSE(pathExists(path));
}

TEST_P(DeleteDirForcefully, RemovesATreeOf10000Entries) {
  std::string path = temp_.dir("tree");
  for (int directory = 0; directory < 100; ++directory) {
    const std::string name = "tree/" + std::to_string(directory);
    const std::string made = temp_.dir(name);
    for (int file = 0; file < 99; ++file) {
      const int descriptor = creat((made + "/" + std::to_string(file)).c_str(), 0444);
      ASSERT_NE(descriptor, -1);
      close(descriptor);
    }
  }
  temp_.dir("tree2");

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("tree2"));
}

TEST_P(DeleteDirForcefully, RemovesATreeDeeperThanAPathMayBeLong) {
  std::string path = temp_.dir("deep");
  apart([&] { EXPECT_EQ(enterDeep(path, 10'000).size(), 10'000U); });
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, LeavesWhatLinksInTheTreeLeadTo) {
  const std::string outside = temp_.dir("outside");
  const std::string file = temp_.file("outside/file", "text");
  std::string path = temp_.dir("tree");
  makeLink(outside, temp_.path("tree/directory"));
  makeLink("../outside", temp_.path("tree/relative"));
  makeLink(file, temp_.path("tree/file"));
  makeLink("/", temp_.path("tree/root"));
  makeLink("nowhere", temp_.path("tree/dangling"));
  ASSERT_EQ(link(file.c_str(), temp_.path("tree/hard").c_str()), 0);

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("outside"));
  EXPECT_THAT(namesIn(outside), ElementsAre("file"));
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, OfALinkToADirectoryRemovesTheLinkOnly) {
  const std::string directory = temp_.dir("directory");
  const std::string file = temp_.file("directory/file", "text");
  std::string path = temp_.path("link");
  makeLink(directory, path);

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_FALSE(pathExists(path));
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(DeleteDirForcefully, DoesNotMindTheNamesInsideTheTree) {
  std::string path = temp_.dir("tree");
  temp_.file("kept", "text");
  for (const char* const name :
       {"a name", " leading", "trailing ", "tab\there", "line\nbreak", "#hash", "-rf", "--", "*",
        "$HOME", "; rm kept", "`x`", "'", "\"", "\\", ".hidden", "..."}) {
    temp_.dir(std::string("tree/") + name);
    temp_.file(std::string("tree/") + name + "/" + name, "text");
  }

  EXPECT_TRUE(deleteDirForcefully(path.data()));

  EXPECT_THAT(namesIn(temp_.path()), ElementsAre("kept"));
}

TEST_P(DeleteDirForcefully, TakesATrailingSlash) {
  std::string path = temp_.dir("directory") + "/";
  temp_.file("directory/file", "text");
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), IsEmpty());
}

TEST_P(DeleteDirForcefully, EmptiesTheTargetOfALinkWithATrailingSlash) {
  temp_.dir("target");
  temp_.file("target/file", "text");
  ASSERT_EQ(symlink("target", temp_.path("link").c_str()), 0);
  std::string path = temp_.path("link") + "/";
  EXPECT_TRUE(deleteDirForcefully(path.data()));
  EXPECT_THAT(namesIn(temp_.path()), UnorderedElementsAre("link", "target"));
  EXPECT_THAT(namesIn(temp_.path("target")), IsEmpty());
}

TEST_P(DeleteDirForcefully, LeavesWhatItMayNotRemoveAndShowsTheRawStatus) {
  openToAll(temp_.path());
  std::string path = temp_.path("tree");
  asOrdinaryUser([&] {
    silence();
    makeDirectory(path);
    makeDirectory(path + "/read-only");
    makeDirectory(path + "/other");
    writeFile(path + "/read-only/file", "text");
    writeFile(path + "/other/file", "text");
    ASSERT_EQ(chmod((path + "/read-only").c_str(), 0555), 0);

    EXPECT_FALSE(deleteDirForcefully(path.data()));

    EXPECT_EQ(trail(),
              traced(call("deleteDirForcefully", 0, isThere(), forced(path), forcedInVain(256))));
    EXPECT_THAT(namesIn(path), ElementsAre("read-only"));
    EXPECT_EQ(contentsOf(path + "/read-only/file"), "text");
    EXPECT_EQ(chmod((path + "/read-only").c_str(), 0755), 0);
  });
}

TEST_P(DeleteDirForcefully, SplitsAPathAtBlanksAndTabs) {
  for (const std::string blank : {" ", "\t", "  ", " \t "}) {
    const TempDir place;
    apart([&] {
      enter(place.path());
      std::string path = "one" + blank + "two";
      for (const std::string& name : {std::string("one"), std::string("two"), path}) {
        makeDirectory(name);
      }
      {
        const FakeSystem shell;
        EXPECT_TRUE(deleteDirForcefully(path.data()));
        EXPECT_THAT(shell.commands(), ElementsAre("rm -rf " + path));
      }
      records_.clear();
      EXPECT_TRUE(deleteDirForcefully(path.data()));
      EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 1, isThere(), forced(path))));
      EXPECT_THAT(namesIn("."), ElementsAre(path));
    });
  }
}

TEST_P(DeleteDirForcefully, TakesAWordThatBeginsWithAHashForAComment) {
  apart([&] {
    enter(temp_.path());
    char hash[] = "#directory";
    makeDirectory(hash);
    {
      const FakeSystem shell;
      EXPECT_TRUE(deleteDirForcefully(hash));
      EXPECT_THAT(shell.commands(), ElementsAre("rm -rf #directory"));
    }
    EXPECT_TRUE(deleteDirForcefully(hash)) << "the command has nothing to do";
    EXPECT_THAT(namesIn("."), ElementsAre("#directory"));

    char second[] = "one #two three";
    for (const std::string name : {"one", "#two", "two", "three", "one #two three"})
      makeDirectory(name);
    EXPECT_TRUE(deleteDirForcefully(second));
    EXPECT_THAT(namesIn("."),
                UnorderedElementsAre("#directory", "#two", "two", "three", "one #two three"));

    char inside[] = "in#side";
    makeDirectory(inside);
    EXPECT_TRUE(deleteDirForcefully(inside));
    EXPECT_FALSE(pathExists(inside)) << "no comment inside a word";
  });
}

TEST_P(DeleteDirForcefully, FindsRmThroughTheProgramsPath) {
  apart([&] {
    const std::string seen = temp_.path("seen");
    const std::string programs = temp_.dir("programs");
    const std::string rm = temp_.file("programs/rm", "#!/bin/sh\necho \"$@\" > " + seen + "\n");
    ASSERT_EQ(chmod(rm.c_str(), 0755), 0);
    std::string path = temp_.dir("tree");
    ASSERT_EQ(setenv("PATH", programs.c_str(), 1), 0);

    EXPECT_TRUE(deleteDirForcefully(path.data()));

    EXPECT_EQ(contentsOf(seen), "-rf " + path + "\n");
    EXPECT_TRUE(pathExists(path));
  });
}

TEST_P(DeleteDirForcefully, TakesAWordThatBeginsWithADashForAnOption) {
  apart([&] {
    silence();
    enter(temp_.path());
    char verbose[] = "-v";
    char unknown[] = "--no-such-option";
    makeDirectory(verbose);
    makeDirectory(unknown);

    EXPECT_TRUE(deleteDirForcefully(verbose)) << "the command has nothing to do";
    records_.clear();
    EXPECT_FALSE(deleteDirForcefully(unknown));

    EXPECT_EQ(trail(), traced(call("deleteDirForcefully", 0, isThere(), forced(unknown),
                                   forcedInVain(256))));
    EXPECT_THAT(namesIn("."), UnorderedElementsAre("-v", "--no-such-option"));
  });
}

// ---- createSymLink ----

TEST_P(CreateSymLink, RefusesANullArgument) {
  const std::string link = temp_.path("link");
  const Trail refused = call("createSymLink", 89, debug("createSymLink: passed a null pointer.\n"));
  const FailingCall made(Call::symlink, 0, kNever);

  EXPECT_EQ(createSymLink(nullptr, link.c_str()), 89);
  EXPECT_EQ(trail(), traced(refused));
  EXPECT_EQ(createSymLink("target", nullptr), 89);
  EXPECT_EQ(trail(), traced(refused));
  EXPECT_EQ(createSymLink(nullptr, nullptr), 89);
  EXPECT_EQ(trail(), traced(refused));

  EXPECT_EQ(made.calls(), 0);
  EXPECT_FALSE(pathExists(link));
}

TEST_P(CreateSymLink, LeadsToTheTargetAsItIsWritten) {
  const std::string file = temp_.file("file", "text");
  int number = 0;
  for (const std::string& target : {file, std::string("file"), std::string("../x y"),
                                    std::string("no/where"), std::string("/")}) {
    SCOPED_TRACE(target);
    const std::string link = temp_.path("link" + std::to_string(number++));
    EXPECT_EQ(createSymLink(target.c_str(), link.c_str()), 0);
    EXPECT_EQ(trail(), traced(no("createSymLink")));
    EXPECT_EQ(targetOf(link), target);
  }
  EXPECT_EQ(contentsOf(temp_.path("link0")), "text");
  EXPECT_EQ(contentsOf(temp_.path("link1")), "text");
}

TEST_P(CreateSymLink, ShowsTheErrorNumberUnderAnotherName) {
  const std::string file = temp_.file("file", "text");
  const std::string directory = temp_.dir("directory");
  makeLink("nowhere", temp_.path("dangling"));
  const auto refused = [](int error_number) {
    return call(
        "createSymLink", -1,
        debug("createDirectory: symlink() failed with rc='" + std::to_string(error_number) + "'"));
  };

  EXPECT_EQ(createSymLink("target", file.c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", directory.c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", temp_.path("dangling").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", temp_.path("missing/link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("", temp_.path("link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("target", ""), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("target", (file + "/link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOTDIR)));
  EXPECT_EQ(createSymLink("target", temp_.path(std::string(300, 'n')).c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENAMETOOLONG)));

  EXPECT_THAT(namesIn(temp_.path()), UnorderedElementsAre("file", "directory", "dangling"));
  EXPECT_EQ(contentsOf(file), "text");
  EXPECT_EQ(targetOf(temp_.path("dangling")), "nowhere");
}

TEST_P(CreateSymLink, WherePermissionsForbidItFails) {
  const std::string closed = temp_.dir("closed");
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  asOrdinaryUser([&] {
    EXPECT_EQ(createSymLink("target", (closed + "/link").c_str()), -1);
    EXPECT_EQ(trail(), traced(call("createSymLink", -1,
                                   debug("createDirectory: symlink() failed with rc='13'"))));
  });
}

TEST_P(CreateSymLink, ReportsAFailedSystemCall) {
  const FailingCall made(Call::symlink, EIO);
  EXPECT_EQ(createSymLink("target", temp_.path("link").c_str()), -1);
  ASSERT_TRUE(made.fired());
  EXPECT_EQ(trail(), traced(call("createSymLink", -1,
                                 debug("createDirectory: symlink() failed with rc='5'"))));
}

// ---- removeSymLink ----

Trail notRemoved(int error_number) {
  return call(
      "removeSymLink", -1,
      debug("removeSymLink: unlink() failed with rc='" + std::to_string(error_number) + "'"));
}

TEST_P(RemoveSymLink, RefusesANullPath) {
  EXPECT_EQ(removeSymLink(nullptr), 89);
  EXPECT_EQ(trail(),
            traced(call("removeSymLink", 89, debug("removeSymLink: passed a null pointer.\n"))));
}

TEST_P(RemoveSymLink, RemovesTheLinkAndNotWhatItLeadsTo) {
  const std::string directory = temp_.dir("directory");
  const std::string file = temp_.file("directory/file", "text");
  const std::string links[] = {temp_.path("to directory"), temp_.path("to file"),
                               temp_.path("dangling")};
  makeLink(directory, links[0]);
  makeLink(file, links[1]);
  makeLink("nowhere", links[2]);

  for (const std::string& link : links) {
    SCOPED_TRACE(link);
    EXPECT_EQ(removeSymLink(link.c_str()), 0);
    EXPECT_EQ(trail(), traced(no("removeSymLink")));
    EXPECT_FALSE(pathExists(link));
  }
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(RemoveSymLink, RemovesAFileToo) {
  const std::string file = temp_.file("file", "text");
  EXPECT_EQ(removeSymLink(file.c_str()), 0);
  EXPECT_EQ(trail(), traced(no("removeSymLink")));
  EXPECT_FALSE(pathExists(file));
}

TEST_P(RemoveSymLink, OfADirectoryOrNothingFails) {
  const std::string directory = temp_.dir("directory");

  EXPECT_EQ(removeSymLink(directory.c_str()), -1);
  EXPECT_EQ(trail(), traced(notRemoved(EISDIR)));
  EXPECT_EQ(removeSymLink(temp_.path("missing").c_str()), -1);
  EXPECT_EQ(trail(), traced(notRemoved(ENOENT)));
  EXPECT_EQ(removeSymLink(""), -1);
  EXPECT_EQ(trail(), traced(notRemoved(ENOENT)));

  EXPECT_TRUE(std::filesystem::is_directory(directory));
}

TEST_P(RemoveSymLink, WherePermissionsForbidItFails) {
  const std::string closed = temp_.dir("closed");
  const std::string link = temp_.path("closed/link");
  makeLink("target", link);
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  asOrdinaryUser([&] {
    EXPECT_EQ(removeSymLink(link.c_str()), -1);
    EXPECT_EQ(trail(), traced(notRemoved(EACCES)));
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_EQ(targetOf(link), "target");
}

TEST_P(RemoveSymLink, ReportsAFailedSystemCall) {
  const std::string link = temp_.path("link");
  makeLink("target", link);
  const FailingCall taken_away(Call::unlink, EBUSY);

  EXPECT_EQ(removeSymLink(link.c_str()), -1);

  ASSERT_TRUE(taken_away.fired());
  EXPECT_EQ(trail(), traced(notRemoved(EBUSY)));
  EXPECT_EQ(targetOf(link), "target");
}

// ---- isEnoughDriveSpace ----

TEST_P(IsEnoughDriveSpace, RefusesANullPath) {
  EXPECT_FALSE(isEnoughDriveSpace(0, nullptr));
  EXPECT_EQ(trail(), traced(call("isEnoughDriveSpace", 0,
                                 debug("isEnoughDriveSpace: passed a null pointer.\n"))));
}

TEST_P(IsEnoughDriveSpace, IsAlwaysThereForNothing) {
  for (const long required : {0L, -1L, LONG_MIN}) {
    std::string directory = temp_.path();
    EXPECT_TRUE(isEnoughDriveSpace(required, directory.data()));
    EXPECT_EQ(trail(), traced(yes("isEnoughDriveSpace")));
    char without_space[] = "/proc";
    EXPECT_TRUE(isEnoughDriveSpace(required, without_space));
    trail();
  }
}

TEST_P(IsEnoughDriveSpace, IsThereForNothingOnTheLargestFileSystems) {
  REQUIRE_ROOT("to mount a large file system");
  const std::string large = temp_.dir("large");
  EXPECT_EQ(withPrivateMounts([&] {
              for (const char* size : {"size=7E", "size=8E", "size=9E", "size=15E"}) {
                SCOPED_TRACE(size);
                if (mount("none", large.c_str(), "tmpfs", 0, size) != 0) return 2;
                for (const long required : {0L, -1L, LONG_MIN}) {
                  std::string path = large;
                  EXPECT_TRUE(isEnoughDriveSpace(required, path.data())) << required;
                }
              }
              return 0;
            }),
            0);
}

TEST_P(IsEnoughDriveSpace, IsNeverThereForEverything) {
  std::string path = temp_.path();
  EXPECT_FALSE(isEnoughDriveSpace(LONG_MAX, path.data()));
  EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, IsNotThereWhereNothingIsStored) {
  char without_space[] = "/proc";
  EXPECT_FALSE(isEnoughDriveSpace(1, without_space));
  EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, OfAMissingPathIsAFailureWithoutAWord) {
  std::string path = temp_.path("missing");
  char empty[] = "";
  for (const long required : {0L, -1L, 1L}) {
    EXPECT_FALSE(isEnoughDriveSpace(required, path.data()));
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
    EXPECT_FALSE(isEnoughDriveSpace(required, empty));
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
  }
}

TEST_P(IsEnoughDriveSpace, CountsWholeMiBThatAreFree) {
  REQUIRE_ROOT("to mount a small file system");
  const std::string small = temp_.dir("small");
  makeLink(small, temp_.path("link"));
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("none", small.c_str(), "tmpfs", 0, "size=4m"), 0);
              const std::string file = small + "/file";
              struct Case {
                long used;
                long free_mib;
              };
              const long page = sysconf(_SC_PAGESIZE);
              for (const Case& each : {Case{0, 4}, Case{1, 3}, Case{kMiB, 3}, Case{kMiB + 1, 2},
                                       Case{4 * kMiB - page, 0}, Case{4 * kMiB, 0}}) {
                SCOPED_TRACE(each.used);
                writeFile(file, std::string(static_cast<size_t>(each.used), 'x'));
                for (std::string path : {small, file, temp_.path("link")}) {
                  EXPECT_TRUE(isEnoughDriveSpace(each.free_mib, path.data()));
                  EXPECT_TRUE(isEnoughDriveSpace(each.free_mib - 1, path.data()));
                  EXPECT_FALSE(isEnoughDriveSpace(each.free_mib + 1, path.data()));
                }
              }
              return 0;
            }),
            0);
}

TEST_P(IsEnoughDriveSpace, CountsNoSpaceThatIsKeptForRoot) {
  struct statvfs space = {};
  ASSERT_EQ(statvfs(temp_.path().c_str(), &space), 0);
  const auto mib = [&](fsblkcnt_t blocks) {
    return static_cast<long>(blocks * space.f_frsize / static_cast<unsigned long>(kMiB));
  };
  const long for_all = mib(space.f_bavail);
  const long for_root = mib(space.f_bfree);
  // Others write here meanwhile: the question must be far from both answers.
  if (for_root - for_all < 1024) GTEST_SKIP() << temp_.path() << " keeps little space for root";
  std::string path = temp_.path();

  EXPECT_FALSE(isEnoughDriveSpace(for_all + (for_root - for_all) / 2, path.data()));
}

TEST_P(IsEnoughDriveSpace, IsTheBlocksForAllTimesTheBlockSize) {
  std::string path = temp_.path();
  const auto expectMiB = [&](long mib) {
    EXPECT_TRUE(isEnoughDriveSpace(mib, path.data())) << mib;
    EXPECT_FALSE(isEnoughDriveSpace(mib + 1, path.data())) << mib;
  };
  {
    const FakeStatfs space(5, 500, kMiB, kMiB);
    expectMiB(5);
  }
  {
    const FakeStatfs space(5, 5, kMiB, 4096);
    expectMiB(5);
  }
  {
    const FakeStatfs space(2559, 2559, 4096, kMiB);
    expectMiB(9);
  }
  const FakeStatfs space(0x7fffffff, 0x7fffffff, 0x7fffffff, 512);  // more than 32 bits
  expectMiB(0x3fffffff00000001 / kMiB);
}

TEST_P(IsEnoughDriveSpace, IsASignedNumberOfBytes) {
  std::string path = temp_.path();
  const FakeStatfs space((1UL << 43) + 1, (1UL << 43) + 1, kMiB, kMiB);  // 2^63 bytes and 1 MiB

  EXPECT_FALSE(isEnoughDriveSpace(1, path.data()));
  EXPECT_TRUE(isEnoughDriveSpace(1 - (1L << 43), path.data()));
}

TEST_P(IsEnoughDriveSpace, IsCutOffTowardsZeroBelowZeroToo) {
  std::string path = temp_.path();
  const FakeStatfs space(~0UL, ~0UL, kMiB - 1, kMiB - 1);  // one byte more than -1 MiB

  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));
  EXPECT_FALSE(isEnoughDriveSpace(1, path.data()));
}

TEST_P(IsEnoughDriveSpace, TakesAPrintThatAnswersAnotherNegativeNumber) {
  std::string path = temp_.path();
  const OddPrint print(-2);
  const LiveAllocations live;

  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));

  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(trail(), traced(yes("isEnoughDriveSpace")));
}

TEST_P(IsEnoughDriveSpace, ReportsThatThePathCannotBeCopied) {
  std::string path = temp_.path();
  const FailingCall print(Call::vra_asprintf, ENOMEM);
  const FailingCall asked(Call::statfs, 0, kNever);

  EXPECT_FALSE(isEnoughDriveSpace(0, path.data()));

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(asked.calls(), 0);
  EXPECT_EQ(trail(), traced(call("isEnoughDriveSpace", 0,
                                 debug("isEnoughDriveSpace: vra_asprintf failed.\n"))));
}

TEST_P(IsEnoughDriveSpace, FreesItsCopyWhateverTheAnswer) {
  std::string path = temp_.path();
  const LiveAllocations live;
  {
    const FailingCall asked(Call::statfs, EIO);
    EXPECT_FALSE(isEnoughDriveSpace(0, path.data()));
    ASSERT_TRUE(asked.fired());
    EXPECT_EQ(trail(), traced(no("isEnoughDriveSpace")));
  }
  EXPECT_TRUE(isEnoughDriveSpace(0, path.data()));
  EXPECT_FALSE(isEnoughDriveSpace(LONG_MAX, path.data()));
  EXPECT_EQ(live.blocks(), 0);
}

// ---- trimLastDirectory ----

TEST_P(TrimLastDirectory, RefusesANullPointer) {
  EXPECT_EQ(trimLastDirectory(nullptr), 1);
  EXPECT_EQ(trail(),
            traced(call("trimLastDirectory", 1, debug("trimLastDirectory: path is null.\n"))));
}

TEST_P(TrimLastDirectory, LeavesANullStringAlone) {
  char* path = nullptr;
  EXPECT_EQ(trimLastDirectory(&path), 0);
  EXPECT_EQ(path, nullptr);
  EXPECT_EQ(trail(), traced(no("trimLastDirectory")));
}

TEST_P(TrimLastDirectory, CutsAtTheLastSlashBehindTheFirstCharacter) {
  struct Case {
    const char* path;
    const char* trimmed;
  };
  for (const Case& each : {
           Case{"/usr/lib", "/usr"},
           Case{"/usr", ""},
           Case{"usr/lib/", "usr/lib"},
           Case{"name", ""},
           Case{"", ""},
           Case{"/", ""},
           Case{"//", "/"},
           Case{"///", "//"},
           Case{"a", ""},
           Case{"a/", "a"},
           Case{"a/b", "a"},
           Case{"/a/", "/a"},
           Case{"//a", "/"},
           Case{"/usr//lib", "/usr/"},
           Case{"/usr/lib//", "/usr/lib/"},
           Case{"./a", "."},
           Case{"../a/..", "../a"},
           Case{"\\usr\\lib", ""},
           Case{"/usr/a\\b", "/usr"},
       }) {
    SCOPED_TRACE(each.path);
    std::string text = each.path;
    char* path = text.data();
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_EQ(path, text.data());
    EXPECT_STREQ(path, each.trimmed);
    EXPECT_EQ(trail(), traced(no("trimLastDirectory")));
    // One byte is written, no more.
    const size_t cut = strlen(each.trimmed);
    std::string expected = each.path;
    if (cut < expected.size()) expected[cut] = '\0';
    EXPECT_EQ(text, expected);
  }
}

TEST_P(TrimLastDirectory, EmptiesAPathStepByStep) {
  std::string text = "/opt/a/b";
  char* path = text.data();
  for (const char* const trimmed : {"/opt/a", "/opt", "", ""}) {
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_STREQ(path, trimmed);
  }
}

// ---- Trace classes, and messages that are not asked for ----

void callAll(const TempDir& temp) {
  std::string path = temp.path("x");
  free(getTempDir());
  free(getSystemDrive());
  getLocalDrives();
  free(getShortname("x"));
  free(getCurrentWorkingDirectory());
  EXPECT_TRUE(createDirectory(path.data(), nullptr, nullptr, 0755));
  EXPECT_TRUE(deleteDirectory(path.c_str()));
  EXPECT_FALSE(deleteDirForcefully(path.data()));
  EXPECT_EQ(createSymLink("target", path.c_str()), 0);
  EXPECT_EQ(removeSymLink(path.c_str()), 0);
  EXPECT_TRUE(isEnoughDriveSpace(0, std::string(temp.path()).data()));
  char* trimmed = path.data();
  EXPECT_EQ(trimLastDirectory(&trimmed), 0);
}

TEST(DirectoriesTrace, HasTrimLastDirectoryInAClassOfItsOwn) {
  const TempDir temp;
  {
    const Records records(kEntryExit43 | kExitError43);
    callAll(temp);
    char* path = nullptr;
    EXPECT_EQ(trimLastDirectory(&path), 0);
    EXPECT_EQ(trimLastDirectory(nullptr), 1);
    EXPECT_THAT(records.trail(), ElementsAre("> trimLastDirectory", "< trimLastDirectory 0",
                                             "> trimLastDirectory", "< trimLastDirectory 0",
                                             "> trimLastDirectory", "<! trimLastDirectory 1"));
  }
  const Records records(kEntryExit33 | kExitError33);
  callAll(temp);
  EXPECT_EQ(records.trail(),
            joined(no("getTempDir"), no("getSystemDrive"), no("getLocalDrives"), no("getShortname"),
                   no("getCurrentWorkingDirectory"),
                   call("createDirectory", 1, no("doesFileExist"), yes("canAccessFile"),
                        yes("setFileOwnersAndPermissions")),
                   removed(), call("deleteDirForcefully", 0, no("doesFileExist")),
                   no("createSymLink"), no("removeSymLink"), yes("isEnoughDriveSpace")));
}

}  // namespace
