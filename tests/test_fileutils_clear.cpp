#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "faults.h"
#include "osutils.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

TRACED_AND_NOT(ClearFile);

TEST_P(ClearFile, RefusesANullPath) {
  EXPECT_FALSE(clearFile(nullptr));
  EXPECT_EQ(trail(), traced(call("clearFile", 0, debugLine("clearFile: passed a null pointer."))));
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
                        errorLine("clearFile: (2) failed to truncate file. errno=24 - Too many "
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
                                   errorLine("clearFile: (2) failed to truncate file. errno=" +
                                             std::to_string(reason) + " - " + strerror(reason)))));
  }
}

TEST_P(ClearFile, LeavesWhatMayNotBeWritten) {
  const std::string path = temp_.file("file", "contents");
  const Permissions read_only(path, 0444);
  EXPECT_EQ(asOrdinaryUser([&] {
              EXPECT_FALSE(clearFile(path.c_str()));
              EXPECT_EQ(trail(), traced(call("clearFile", 0, no("isDirectory"),
                                             errorLine("clearFile: (2) failed to truncate file. "
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
                          errorLine("clearFile: (1) failed to truncate file. errno=5 - "
                                    "Input/output error"))));
    EXPECT_EQ(lock.calls(), 2);
    EXPECT_EQ(openDescriptors(), open_before);
  }
  EXPECT_EQ(contentsOf(existing), "contents");
  EXPECT_EQ(contentsOf(made), "");  // created by open64()
}

TEST_P(ClearFile, FailsOnAPipeWhichHasNoLength) {
  const std::string path = temp_.path("fifo");
  makeFifo(path);
  const int reader = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  ASSERT_NE(reader, -1);
  EXPECT_FALSE(clearFile(path.c_str()));
  EXPECT_EQ(trail(),
            traced(call("clearFile", 0, no("isDirectory"),
                        errorLine("clearFile: (1) failed to truncate file. errno=22 - Invalid "
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
  EXPECT_EQ(lock.calls(), 7);  // and one for the release
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

// Returns the lock on the file that another process sees; F_UNLCK if there is none.
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
  EXPECT_EQ(seen.l_len, 0);  // 0: up to the end of the file
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
    usleep(100'000);  // if the lock did not work, clearFile() would return meanwhile
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

}  // namespace
