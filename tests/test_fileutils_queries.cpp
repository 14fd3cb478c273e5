#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

TRACED_AND_NOT(FileQueries);
TRACED_AND_NOT(CanWriteToFile);
TRACED_AND_NOT(CheckFilePerms);
TRACED_AND_NOT(GetFileNameFromPath);

// ---- doesFileExist, canAccessFile, isDirectory, isFile ----

TEST_P(FileQueries, RefuseANullPath) {
  EXPECT_FALSE(doesFileExist(nullptr));
  EXPECT_EQ(trail(),
            traced(call("doesFileExist", 0, debugLine("doesFileExist: passed a null pointer."))));
  EXPECT_FALSE(canAccessFile(nullptr));
  EXPECT_EQ(trail(),
            traced(call("canAccessFile", 0, debugLine("canAccessFile: passed a null pointer."))));
  EXPECT_FALSE(isDirectory(nullptr));
  EXPECT_EQ(trail(),
            traced(call("isDirectory", 0, debugLine("isDirectory: passed a null pointer."))));
  EXPECT_FALSE(isFile(nullptr));
  EXPECT_EQ(trail(), traced(call("isFile", 0, debugLine("isFile: passed a null pointer."))));
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
      {temp_.path("socket"), true,
       true},  // the type bits of a socket include those of a file and a directory
      {"/dev/null", false, false},
  };
  for (Case each : cases) {
    SCOPED_TRACE(each.path);
    // Opening the pipe would block until its other end is opened.
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
    EXPECT_TRUE(canAccessFile(path.c_str()));  // no permission is missing
    EXPECT_EQ(trail(), traced(query("canAccessFile", 1, reason)));
    EXPECT_FALSE(isDirectory(path.c_str()));
    EXPECT_EQ(trail(), traced(query("isDirectory", 0, reason)));
    EXPECT_FALSE(isFile(path.data()));
    EXPECT_EQ(trail(), traced(query("isFile", 0, reason)));
  }
}

TEST_P(FileQueries, SayNothingOfThePathBefore) {
  std::string file = temp_.file("file", "text");
  std::string missing = temp_.path("missing");
  EXPECT_TRUE(isFile(file.data()));
  EXPECT_FALSE(isFile(missing.data()));
  EXPECT_TRUE(isDirectory(temp_.path().c_str()));
  EXPECT_FALSE(isDirectory(missing.c_str()));
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
              // The directory itself is visible.
              EXPECT_TRUE(doesFileExist(closed.c_str()));
              EXPECT_TRUE(canAccessFile(closed.c_str()));
              return 0;
            }),
            0);
}

TEST_P(FileQueries, SayNoWheneverStatFails) {
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
            traced(call("canWriteToFile", 0, debugLine("canWriteToFile: passed a null pointer."))));
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
                                 debugLine("canWriteToFile: fopen - errno =24"))));
}

TEST_P(CanWriteToFile, FailsBelowAMissingDirectoryAndMakesNothing) {
  std::string path = temp_.path("none/file");

  EXPECT_FALSE(canWriteToFile(path.data()));

  EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, query("isDirectory", 0, ENOENT),
                                 debugLine("canWriteToFile: fopen - errno =2"))));
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
                                             debugLine("canWriteToFile: fopen - errno =13"))));
              EXPECT_FALSE(canWriteToFile(none.data()));
              EXPECT_EQ(trail(), traced(call("canWriteToFile", 0, query("isDirectory", 0, ENOENT),
                                             debugLine("canWriteToFile: fopen - errno =13"))));
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
                                             debugLine("canWriteToFile: fopen - errno =30"))));
              return 0;
            }),
            0);
}

// ---- checkFilePerms ----

TEST_P(CheckFilePerms, RefusesANullPath) {
  EXPECT_EQ(checkFilePerms(nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(trail(), traced(call("checkFilePerms", 89,
                                 debugLine("checkFilePerms: passed a null pointer."))));
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
  const std::string directory = temp_.dir("100%s%n");  // must not be used as a format string
  makeLink(directory, temp_.path("link"));
  makeSocket(temp_.path("socket"));
  for (const std::string& path : {directory, temp_.path("link"), temp_.path("socket")}) {
    SCOPED_TRACE(path);
    EXPECT_EQ(checkFilePerms(path.c_str()), OSUTILS_CONSTRAINT_VIOLATION);
    EXPECT_EQ(trail(), traced(call("checkFilePerms", 19, yes("doesFileExist"), yes("isDirectory"),
                                   errorLine("checkFilePerms - " + path + " is a directory."))));
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
                          debugLine("checkFilePerms - The file " + path + " does not exist."))));
  }
}

TEST_P(CheckFilePerms, ReportsAFileThatPermissionsHide) {
  const std::string closed = temp_.dir("closed");
  const std::string inside = temp_.file("closed/inside", "text");
  const Permissions unsearchable(closed, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_EQ(checkFilePerms(inside.c_str()), OSUTILS_INSUFFICIENT_ACCESS);
              EXPECT_EQ(trail(), traced(call("checkFilePerms", 50, hidden(),
                                             debugLine("checkFilePerms - The file " + inside +
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
  EXPECT_EQ(
      trail(),
      traced(call("checkFilePerms", 32, query("doesFileExist", 0, ENOENT), yes("canAccessFile"),
                  debugLine("checkFilePerms - The file " + path + " does not exist."))));
}

// ---- getFileNameFromPath ----

TEST_P(GetFileNameFromPath, RefusesANullPath) {
  EXPECT_EQ(getFileNameFromPath(nullptr), nullptr);
  EXPECT_EQ(trail(), traced(call("getFileNameFromPath", 0,
                                 errorLine("Error - getFileNameFromPath: path is NULL"))));
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

// ---- Trace mask ----

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
