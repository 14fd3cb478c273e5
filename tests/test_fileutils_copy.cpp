#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pwd.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "small_stack.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

TRACED_AND_NOT(CopyFile);

// ---- copyFile ----

TEST_P(CopyFile, RefusesANullPath) {
  std::string path = temp_.file("file", "text");
  EXPECT_FALSE(copyFile(nullptr, path.data(), nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("copyFile", 0, debugLine("copyFile: passed a null pointer."))));
  EXPECT_FALSE(copyFile(path.c_str(), nullptr, nullptr, nullptr, 0640));
  EXPECT_EQ(trail(), traced(call("copyFile", 0, debugLine("copyFile: passed a null pointer."))));
  EXPECT_EQ(contentsOf(path), "text");
}

TEST_P(CopyFile, MakesAMissingDestination) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  const int open_before = openDescriptors();

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0604));

  EXPECT_EQ(trail(), traced(call("copyFile", 1, kCopySource, query("doesFileExist", 0, ENOENT),
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
  std::string user = "no-such-user";  // not looked up

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), user.data(), nullptr, 0777));

  EXPECT_EQ(trail(), traced(call("copyFile", 1, kCopySource, yes("doesFileExist"), writable())));
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
  // The second call would copy the data that was added after the first, but it fails.
  const BeforeCall grown(
      Call::copy_file_range, [&] { writeFile(source, beginning + rest); }, 2);
  const FailingCall kernel_copy(Call::copy_file_range, EXDEV, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(grown.fired() && kernel_copy.fired());
  EXPECT_TRUE(contentsOf(destination) == beginning + rest);
}

// Covers the kernel's copy between two file systems.
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
  REQUIRE_OWN_MALLOC();  // a sanitizer also enlarges the frames
  const std::string contents = randomBytes(200'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.file("destination", "old");
  for (const int reason : {0, EXDEV, ENOSYS}) {
    SCOPED_TRACE(reason);
    // First on a large stack: the loader resolves the symbols during the first call.
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

TEST_P(CopyFile, DoesNotReportAFailedWriteAndWritesNothingAfterTheGap) {
  const std::string contents = randomBytes(300'000);
  const std::string source = temp_.file("source", contents);
  std::string destination = temp_.path("destination");
  const FailingCall kernel_copy(Call::copy_file_range, ENOSYS);
  const FailingCall reading(Call::read, EIO, 1000);  // counts only
  const FailingCall writing(Call::write, ENOSPC, 2);

  EXPECT_TRUE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  ASSERT_TRUE(writing.fired());
  EXPECT_EQ(writing.calls(), 2);
  EXPECT_GT(reading.calls(), 3);  // the source is still read to its end
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
              EXPECT_EQ(trail(), traced(call("copyFile", 1, kCopySource, missing(),
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

// ext4 flushes a truncated file at its next close (auto_da_alloc). That close must come after the
// contents are written.
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

    EXPECT_EQ(trail(), traced(call("copyFile", 1, kCopySource, yes("doesFileExist"), writable())));
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

TEST_P(CopyFile, RefusesASourceThatIsNotAFile) {
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

  EXPECT_EQ(trail(), traced(call("copyFile", 0, kCopySource, yes("doesFileExist"),
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
              EXPECT_EQ(trail(),
                        traced(call("copyFile", 0, kCopySource, yes("doesFileExist"),
                                    call("canWriteToFile", 0, no("isDirectory"),
                                         debugLine("canWriteToFile: fopen - errno =13")))));
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
              EXPECT_EQ(trail(), traced(call("copyFile", 0, kCopySource, hidden())));
              return 0;
            }),
            0);
}

TEST_P(CopyFile, ReportsADestinationThatCannotBeMade) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("none/destination");

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

  EXPECT_EQ(trail(),
            traced(call("copyFile", 0, kCopySource, missing(),
                        call("createFile", 0, missing(), errorLine("createFile: open - errno =2")),
                        debugLine("copyFile: Cannot create destination file"))));
}

TEST_P(CopyFile, LeavesNoDestinationOfAnUnknownUser) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.path("destination");
  std::string user = "no-such-user";

  EXPECT_FALSE(copyFile(source.c_str(), destination.data(), user.data(), nullptr, 0640));

  EXPECT_EQ(
      trail(),
      traced(call(
          "copyFile", 0, kCopySource, missing(),
          call("createFile", 0, missing(),
               call("setFileOwnersAndPermissions", 0,
                    debugLine("vra_get_uid: name=no-such-user uid=-99"),
                    debugLine("setFileOwnersAndPermissions: user no-such-user does not exist.")),
               errorLine("createFile: Cannot set the file permissions"), kDeleted),
          debugLine("copyFile: Cannot create destination file"))));
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
                        traced(call("copyFile", 0, kCopySource, missing(), createdForOwnAccount(),
                                    errorLine("copyFile: (1) fopen - errno =13"))));
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
    EXPECT_EQ(trail(), traced(call("copyFile", 0, kCopySource, missing(), createdForOwnAccount(),
                                   errorLine("copyFile: (1) fopen - errno =23"))));
    EXPECT_EQ(contentsOf(destination), "");
    EXPECT_EQ(openDescriptors(), open_before);
  }
}

TEST_P(CopyFile, LeavesAnExistingDestinationAsItIsWhenEitherOpenFails) {
  const std::string source = temp_.file("source", "contents");
  std::string destination = temp_.file("destination", "kept");
  const int open_before = openDescriptors();
  for (const int nth : {2, 3}) {  // canWriteToFile() makes the first call
    SCOPED_TRACE(nth);
    const FailingCall opened(Call::fopen64, EMFILE, nth);

    EXPECT_FALSE(copyFile(source.c_str(), destination.data(), nullptr, nullptr, 0640));

    ASSERT_TRUE(opened.fired());
    EXPECT_EQ(trail(), traced(call("copyFile", 0, kCopySource, yes("doesFileExist"), writable(),
                                   errorLine("copyFile: (1) fopen - errno =24"))));
    EXPECT_EQ(contentsOf(destination), "kept");
    EXPECT_EQ(openDescriptors(), open_before);
  }
}

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

}  // namespace
