#include "world.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <exception>
#include <filesystem>
#include <fstream>
#include <iterator>

// Defined only in a program that is instrumented for coverage.
extern "C" void __gcov_init(void*) __attribute__((weak));

// Defined only with a sanitizer that looks for leaks. Returns nonzero if it found any.
extern "C" int __lsan_do_recoverable_leak_check() __attribute__((weak));

namespace {

constexpr int kFailedInChild = 99;

bool anyFailure(const testing::TestResult& result, int from) {
  for (int part = from; part < result.total_part_count(); ++part) {
    if (result.GetTestPartResult(part).failed()) return true;
  }
  return false;
}

// Runs the body in the child. Counts only failures from here on, not earlier ones of the parent.
int runAndJudge(const std::function<int()>& body) {
  const testing::TestInfo* const info = testing::UnitTest::GetInstance()->current_test_info();
  const int before = info == nullptr ? 0 : info->result()->total_part_count();
  int result = kFailedInChild;
  try {
    result = body();
  } catch (const std::exception& error) {
    printf("a child threw: %s\n", error.what());
    return kFailedInChild;
  } catch (...) {
    printf("a child threw something that is not a std::exception\n");
    return kFailedInChild;
  }
  return info != nullptr && anyFailure(*info->result(), before) ? kFailedInChild : result;
}

[[noreturn]] void leaveChild(int result) {
  fflush(nullptr);
  // Each shared object writes its counters in its own destructors. In other builds the parent's
  // destructors must not run.
  if (__gcov_init != nullptr) exit(result);
  if (__lsan_do_recoverable_leak_check != nullptr && __lsan_do_recoverable_leak_check() != 0) {
    result = kFailedInChild;
  }
  _exit(result);
}

// A condition for running the body in the child; the message names what is unavailable.
bool require(bool done, const char* what) {
  if (!done) printf("cannot prepare the child: %s: %s\n", what, strerror(errno));
  return done;
}

// Returns the id of the mount, or 0 before Linux 5.8.
uint64_t mountOf(int directory) {
  struct statx status = {};
  (void)statx(directory, "", AT_EMPTY_PATH, STATX_MNT_ID, &status);
  return status.stx_mnt_id;
}

// Leaves / as the root directory, and the directory above it as the current one.
bool stepOutOfChroot(int inside) {
  // Any other root directory lets `inside` be left through "..".
  if (chroot("/etc") != 0 || fchdir(inside) != 0 || chdir("..") != 0) return false;
  const int above = open(".", O_PATH | O_DIRECTORY | O_CLOEXEC);
  return above != -1 && fchdir(inside) == 0 && chroot(".") == 0 && fchdir(above) == 0 &&
         close(above) == 0;
}

// Makes the mount of the nearest mount point at or above the current directory private. Fails at the
// top of the tree, which is its own parent.
bool climbToMountPoint(int inside) {
  struct stat here = {};
  struct stat last = {};
  while (mount("none", ".", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    last = here;
    if (errno != EINVAL || stat(".", &here) != 0) return false;
    if (here.st_dev == last.st_dev && here.st_ino == last.st_ino) return false;
    if (chdir("..") != 0) return false;
  }
  const int reached = open(".", O_PATH | O_DIRECTORY | O_CLOEXEC);
  const bool same = mountOf(reached) == mountOf(inside);  // no other mount hides it
  close(reached);
  return same;
}

// In a chroot, / need not be a mount point, and mounts below it could propagate to the mount table
// outside. Makes the mount that has / private, from its mount point above.
bool privateMountsOfChroot() {
  const int inside = open("/", O_PATH | O_DIRECTORY | O_CLOEXEC);
  const int current = open(".", O_PATH | O_DIRECTORY | O_CLOEXEC);
  return require(inside != -1 && current != -1, "directories") &&
         require(stepOutOfChroot(inside), "a step out of the chroot") &&
         require(climbToMountPoint(inside), "private mounts of the chroot") &&
         require(fchdir(current) == 0 && close(current) == 0 && close(inside) == 0,
                 "return into the chroot");
}

bool ownMounts() {
  if (!require(unshare(CLONE_NEWNS) == 0, "unshare")) return false;
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0) return true;
  return require(errno == EINVAL, "private mounts") && privateMountsOfChroot();
}

// Other account sources would know accounts that are in no file.
bool writtenAccountSources(const std::string& path) {
  std::ofstream file(path);
  file << "passwd: files\ngroup: files\nshadow: files\nhosts: files\nservices: files\n";
  file.close();
  return require(file.good(), "nsswitch.conf");
}

bool ownEtc(const std::string& scratch) {
  const std::string copy = scratch + "/etc";
  const std::string command = "cp -a /etc '" + copy + "'";
  return require(mount("osutils-test", scratch.c_str(), "tmpfs", 0, "mode=0755") == 0, "tmpfs") &&
         require(system(command.c_str()) == 0, "copy of /etc") &&
         writtenAccountSources(copy + "/nsswitch.conf") &&
         require(mount(copy.c_str(), "/etc", nullptr, MS_BIND, nullptr) == 0, "bind of /etc");
}

}  // namespace

TempDir::TempDir() : path_((std::filesystem::temp_directory_path() / "osutils-XXXXXX").string()) {
  if (mkdtemp(path_.data()) == nullptr || chmod(path_.c_str(), 0755) != 0) {
    perror(path_.c_str());
    abort();
  }
}

TempDir::~TempDir() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

std::string TempDir::path(std::string_view name) const { return path_ + "/" + std::string(name); }

std::string TempDir::file(std::string_view name, std::string_view contents) const {
  const std::string made = path(name);
  writeFile(made, contents);
  EXPECT_EQ(chmod(made.c_str(), 0644), 0) << made;
  return made;
}

std::string TempDir::dir(std::string_view name) const {
  const std::string made = path(name);
  EXPECT_TRUE(std::filesystem::create_directory(made)) << made;
  EXPECT_EQ(chmod(made.c_str(), 0755), 0) << made;
  return made;
}

std::string contentsOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  EXPECT_TRUE(file.is_open()) << path;
  std::string contents;
  char block[16 * 1024];
  while (file.read(block, sizeof block), file.gcount() > 0) {
    contents.append(block, static_cast<size_t>(file.gcount()));
  }
  return contents;
}

void writeFile(const std::string& path, std::string_view contents) {
  std::ofstream file(path, std::ios::binary | std::ios::trunc);
  file.write(contents.data(), static_cast<std::streamsize>(contents.size()));
  file.close();
  EXPECT_TRUE(file) << path;
}

bool hasTerminals() {
  const int terminal = posix_openpt(O_RDWR | O_NOCTTY);
  if (terminal != -1) close(terminal);
  return terminal != -1;
}

Terminal openTerminal() {
  const int manager = posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC);
  EXPECT_EQ(unlockpt(manager), 0) << strerror(errno);
  const int subsidiary = ioctl(manager, TIOCGPTPEER, O_RDWR | O_NOCTTY | O_CLOEXEC);
  EXPECT_NE(subsidiary, -1) << strerror(errno);
  return {manager, subsidiary};
}

bool pathExists(const std::string& path) {
  struct stat status;
  return lstat(path.c_str(), &status) == 0;
}

unsigned int modeOf(const std::string& path) {
  struct stat status = {};
  EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
  return status.st_mode & 07777U;
}

int openDescriptors() {
  DIR* const list = opendir("/proc/self/fd");
  if (list == nullptr) {
    ADD_FAILURE() << "/proc/self/fd: " << strerror(errno);
    return -1;
  }
  int count = 0;
  while (const dirent* entry = readdir(list)) {
    if (entry->d_name[0] != '.') ++count;
  }
  closedir(list);
  return count - 1;  // the one that read the list
}

int inChild(const std::function<int()>& body) {
  fflush(nullptr);  // otherwise the child would write the parent's buffered output again
  const pid_t child = fork();
  if (child == -1) {
    ADD_FAILURE() << "fork: " << strerror(errno);
    return -1;
  }
  if (child == 0) leaveChild(runAndJudge(body));

  int status = 0;
  while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
  }
  if (!WIFEXITED(status)) {
    ADD_FAILURE() << "the child did not exit; wait status " << status;
    return -1;
  }
  return WEXITSTATUS(status);
}

int asUser(uid_t uid, const std::function<int()>& body) {
  return inChild([&] {
    // The saved id stays that of root, so that the child can write its coverage files at its end.
    if (!require(setgroups(0, nullptr) == 0 && setresgid(uid, uid, uid) == 0 &&
                     setresuid(uid, uid, 0) == 0,
                 "change of user")) {
      return kFailedInChild;
    }
    const int result = body();
    return require(seteuid(0) == 0, "seteuid") ? result : kFailedInChild;
  });
}

int withPrivateEtc(const std::function<int()>& body) {
  const TempDir scratch;
  return inChild([&] { return ownMounts() && ownEtc(scratch.path()) ? body() : kFailedInChild; });
}

int withPrivateNetwork(const std::function<int()>& body) {
  return withPrivateEtc([&] {
    const bool done = require(unshare(CLONE_NEWNET | CLONE_NEWUTS) == 0, "network and host name");
    return done ? body() : kFailedInChild;
  });
}

int withPrivateMounts(const std::function<int()>& body) {
  return inChild([&] { return ownMounts() ? body() : kFailedInChild; });
}
