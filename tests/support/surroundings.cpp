#include "surroundings.h"

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <utility>

#include "world.h"

namespace surroundings {
namespace {

using std::filesystem::path;

constexpr int kStandardDescriptors = 3;

// ---- Disks ----

std::string fillerOf(const Disk& disk) { return disk.path + "/filler"; }

bool cannotMake(const Disk& disk, int error) {
  const std::string name = disk.path + "/probe";
  const int descriptor = open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (descriptor == -1) return errno == error;
  const bool refused = write(descriptor, "x", 1) == -1 && errno == error;
  (void)close(descriptor);
  (void)unlink(name.c_str());
  return refused;
}

void fillBlocks(const Disk& disk) {
  const int descriptor = open(fillerOf(disk).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  static const char block[size_t{256} * 1024] = {};
  while (write(descriptor, block, sizeof block) > 0) {  // the last one in part
  }
  (void)close(descriptor);
}

void fillNodes(const Disk& disk) {
  const std::string directory = fillerOf(disk);
  char name[512];
  int made = mkdir(directory.c_str(), 0700);
  for (int number = 0; made != -1; ++number) {
    (void)snprintf(name, sizeof name, "%s/%d", directory.c_str(), number);
    made = mknod(name, S_IFREG | 0600, 0);
  }
}

void removeFiller(const Disk& disk) { std::filesystem::remove_all(fillerOf(disk)); }

void remount(const Disk& disk, unsigned long flags) {
  (void)mount(nullptr, disk.path.c_str(), nullptr, MS_REMOUNT | flags, nullptr);
}

// ---- Directories of the system ----

// Follows the links to the directory, on which alone something can be mounted.
std::string real(const char* directory) { return std::filesystem::canonical(directory).string(); }

Surrounding withEmpty(std::string name, const char* directory, std::string missing) {
  return {.name = std::move(name),
          .enter =
              [directory](const Disk&) {
                (void)mount("osutils-test", real(directory).c_str(), "tmpfs", 0, "mode=0755");
              },
          .holds = [missing = std::move(missing)](const Disk&) { return !pathExists(missing); },
          .leave = [directory](const Disk&) { (void)umount2(real(directory).c_str(), MNT_DETACH); },
          .is_remembered = true};
}

void enterDeletedDirectory(const Disk& disk) {
  const std::string directory = disk.path + "/deleted";
  (void)mkdir(directory.c_str(), 0755);
  (void)chdir(directory.c_str());
  (void)rmdir(directory.c_str());
}

// ---- Limits ----

// Keeps the hard limit, so that leaving is possible without privileges.
void limit(int resource, rlim_t value) {
  rlimit now;
  (void)getrlimit(static_cast<__rlimit_resource_t>(resource), &now);
  now.rlim_cur = value;
  (void)setrlimit(static_cast<__rlimit_resource_t>(resource), &now);
}

void unlimit(int resource) {
  rlimit now;
  (void)getrlimit(static_cast<__rlimit_resource_t>(resource), &now);
  now.rlim_cur = now.rlim_max;
  (void)setrlimit(static_cast<__rlimit_resource_t>(resource), &now);
}

Surrounding withDescriptors(rlim_t count) {
  return {.name = "DescriptorsBelow" + std::to_string(count),
          .enter = [count](const Disk&) { limit(RLIMIT_NOFILE, count); },
          .holds =
              [count](const Disk&) {
                const int least = fcntl(0, F_DUPFD_CLOEXEC, static_cast<int>(count) - 1);
                if (least != -1) (void)close(least);
                return fcntl(0, F_DUPFD_CLOEXEC, static_cast<int>(count)) == -1 && errno == EINVAL;
              },
          .leave = [](const Disk&) { unlimit(RLIMIT_NOFILE); },
          .few_descriptors = true,
          .is_remembered = true};
}

void ignoreSignal(int) {}

Surrounding withoutFileGrowth(std::string name, sighandler_t handler) {
  return {.name = std::move(name),
          .enter =
              [handler](const Disk&) {
                (void)signal(SIGXFSZ, handler);
                limit(RLIMIT_FSIZE, 0);
              },
          .holds =
              [handler](const Disk& disk) { return handler == SIG_DFL || cannotMake(disk, EFBIG); },
          .leave = [](const Disk&) { unlimit(RLIMIT_FSIZE); },
          .ends_writers = handler == SIG_DFL};
}

void becomeNobody() {
  (void)setgroups(0, nullptr);
  (void)setresgid(kNobody, kNobody, 0);
  (void)setresuid(kNobody, kNobody, 0);
}

bool cannotFork() {
  const pid_t child = fork();
  if (child == 0) _exit(0);
  if (child > 0) (void)waitpid(child, nullptr, 0);
  return child == -1 && errno == EAGAIN;
}

// A block of memory that was taken to leave none for others.
struct Taken {
  Taken* next;
};
Taken* taken = nullptr;

rlim_t addressSpace() {
  unsigned long pages = 0;
  FILE* const file = fopen("/proc/self/statm", "re");
  if (file == nullptr || fscanf(file, "%lu", &pages) != 1) abort();
  (void)fclose(file);
  return pages * static_cast<rlim_t>(sysconf(_SC_PAGESIZE));
}

// Leaves the process its memory and `more` bytes. With `block`, no free block of that size or larger
// is left.
Surrounding withMemory(std::string name, rlim_t more, size_t block = 0) {
  return {.name = std::move(name),
          .enter =
              [more, block](const Disk&) {
                limit(RLIMIT_AS, addressSpace() + more);
                if (block == 0) return;
                while (auto* const memory = static_cast<Taken*>(malloc(block))) {
                  memory->next = taken;
                  taken = memory;
                }
              },
          .holds =
              [more, block](const Disk&) {
                void* const memory = malloc(block == 0 ? more + 1024 * 1024 : block);
                free(memory);
                return memory == nullptr;
              },
          .leave =
              [](const Disk&) {
                unlimit(RLIMIT_AS);
                while (taken != nullptr) free(std::exchange(taken, taken->next));
              },
          .limits_memory = true};
}

Surrounding withClosed(unsigned closed) {
  std::string name = "Closed";
  for (int descriptor = 0; descriptor < kStandardDescriptors; ++descriptor) {
    if ((closed & (1U << descriptor)) != 0) name += std::to_string(descriptor);
  }
  return {.name = name,
          .enter =
              [closed](const Disk&) {
                for (int descriptor = 0; descriptor < kStandardDescriptors; ++descriptor) {
                  if ((closed & (1U << descriptor)) != 0) (void)close(descriptor);
                }
              },
          .holds =
              [closed](const Disk&) {
                for (int descriptor = 0; descriptor < kStandardDescriptors; ++descriptor) {
                  const bool is_closed = fcntl(descriptor, F_GETFD) == -1;
                  if (is_closed != ((closed & (1U << descriptor)) != 0)) return false;
                }
                return true;
              },
          .closed = closed};
}

}  // namespace

std::vector<Surrounding> all() {
  std::vector<Surrounding> all = {
      {.name = "FullFileSystem",
       .enter = fillBlocks,
       .holds = [](const Disk& disk) { return cannotMake(disk, ENOSPC); },
       .leave = removeFiller},
      {.name = "FileSystemWithoutNodes",
       .enter = fillNodes,
       .holds = [](const Disk& disk) { return cannotMake(disk, ENOSPC); },
       .leave = removeFiller},
      {.name = "ReadOnlyFileSystem",
       .enter = [](const Disk& disk) { remount(disk, MS_RDONLY); },
       .holds = [](const Disk& disk) { return cannotMake(disk, EROFS); },
       .leave = [](const Disk& disk) { remount(disk, 0); }},
      withoutFileGrowth("NoFileGrowthSignalIgnored", SIG_IGN),
      withoutFileGrowth("NoFileGrowthSignalCaught", ignoreSignal),
      withoutFileGrowth("NoFileGrowthSignalNotIgnored", SIG_DFL),
      {.name = "OtherUserWithoutProcesses",
       .enter =
           [](const Disk&) {
             becomeNobody();
             limit(RLIMIT_NPROC, 0);
           },
       .holds = [](const Disk&) { return cannotFork(); },
       .leave = [](const Disk&) { (void)(setresuid(0, 0, 0) + setresgid(0, 0, 0)); },
       .user = kNobody},
      withMemory("NoMemory", 0, sizeof(Taken)),
      withMemory("MemoryInSmallBlocks", 0, 256),
      withMemory("MemoryInBlocksBelow4K", 0, 4096),
      withMemory("MemoryInBlocksBelow64K", 0, size_t{64} * 1024),
      withMemory("MemoryOf64K", size_t{64} * 1024),
      withMemory("MemoryOf1M", size_t{1024} * 1024),
      withMemory("MemoryOf16M", size_t{16} * 1024 * 1024),
      withEmpty("NoShell", "/bin", "/bin/sh"),
      withEmpty("EmptyEtc", "/etc", "/etc/passwd"),
      withEmpty("NoNullDevice", "/dev", "/dev/null"),
      {.name = "DeletedWorkingDirectory",
       .enter = enterDeletedDirectory,
       .holds =
           [](const Disk&) {
             char directory[4096];
             return getcwd(directory, sizeof directory) == nullptr && errno == ENOENT;
           },
       .leave = [](const Disk&) { (void)chdir("/"); }},
  };
  for (rlim_t count = 3; count <= 8; ++count) all.push_back(withDescriptors(count));
  for (unsigned closed = 1; closed < 1U << kStandardDescriptors; ++closed) {
    all.push_back(withClosed(closed));
  }
  return all;
}

int withDisk(const std::function<int(const Disk&)>& body) {
  const TempDir scratch;
  return withPrivateNetwork([&]() -> int {
    const std::string path = scratch.dir("disk");
    if (mount("osutils-test", path.c_str(), "tmpfs", 0, "mode=0755,size=2m,nr_inodes=100") != 0 ||
        unshare(CLONE_NEWPID) != 0) {
      perror("cannot prepare the disk");
      return 1;
    }
    const int result = inChild([&] {
      if (setsid() == -1 || mount("proc", "/proc", "proc", 0, nullptr) != 0) {
        perror("cannot prepare the process namespace");
        return 1;
      }
      return body({path, path + "/work", path + "/traces"});
    });
    // LeakSanitizer cannot fork any more: the namespace has lost its first process.
    fflush(nullptr);
    _exit(result);
  });
}

void clear(const Disk& disk) {
  for (const auto& each : std::filesystem::directory_iterator(disk.path)) {
    std::filesystem::remove_all(each);
  }
  (void)mkdir(disk.work.c_str(), 0755);
}

void handOver(const Surrounding& surrounding, const Disk& disk) {
  (void)chown(disk.path.c_str(), surrounding.user, surrounding.user);
  (void)chown(disk.work.c_str(), surrounding.user, surrounding.user);
}

namespace {

constexpr char kContents[] = "of the program\n";

std::string nameOf(const std::string& directory, int descriptor) {
  return directory + "/standard" + std::to_string(descriptor);
}

}  // namespace

StandardFiles::StandardFiles(std::string directory) : directory_(std::move(directory)) {}

bool StandardFiles::open() const {
  for (int descriptor = 0; descriptor < kStandardDescriptors; ++descriptor) {
    const std::string name = nameOf(directory_, descriptor);
    writeFile(name, kContents);
    const int opened = ::open(name.c_str(), O_RDWR);
    if (opened == -1 || dup2(opened, descriptor) == -1) return false;
    if (opened >= kStandardDescriptors) (void)close(opened);
  }
  return true;
}

std::string StandardFiles::changes(bool may_print_errors) const {
  std::string changes;
  const int end = may_print_errors ? STDERR_FILENO : kStandardDescriptors;
  for (int descriptor = 0; descriptor < end; ++descriptor) {
    const std::string contents = contentsOf(nameOf(directory_, descriptor));
    if (contents != kContents || lseek(descriptor, 0, SEEK_CUR) > 0) {
      changes += " used descriptor " + std::to_string(descriptor) + ": " + contents;
    }
  }
  return changes;
}

}  // namespace surroundings
