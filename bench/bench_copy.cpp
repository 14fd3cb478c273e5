// copyFile compared with `cp`, and with the same calls of the C library alone.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "ldtr.h"
#include "osutils.h"
#include "unavailable.h"

namespace {

constexpr uintmax_t kMiB = 1024 * 1024;
constexpr unsigned int kMode = 0640;

// The names and numbers of the user who runs the benchmark; looked up once.
struct Owner {
  std::string user;
  std::string group;
  uid_t uid;
  gid_t gid;
};

const Owner& owner() {
  static const Owner found = [] {
    const passwd* const account = getpwuid(geteuid());
    const group* const primary = account == nullptr ? nullptr : getgrgid(account->pw_gid);
    if (primary == nullptr) return Owner{"", "", 0, 0};
    return Owner{account->pw_name, primary->gr_name, account->pw_uid, account->pw_gid};
  }();
  return found;
}

// Writes the blocks of the source to the disk, so that no copy has to wait for it.
bool makeSource(const std::string& path, uintmax_t bytes) {
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (file == -1) return false;
  const std::vector<char> block(kMiB, 'x');
  bool complete = true;
  for (uintmax_t written = 0; complete && written < bytes; written += block.size()) {
    complete = write(file, block.data(), block.size()) == static_cast<ssize_t>(block.size());
  }
  complete = fsync(file) == 0 && complete;
  return close(file) == 0 && complete;
}

bool copyWithCp(const std::string& source, const std::string& destination) {
  std::string command = "cp";
  std::string from = source;
  std::string to = destination;
  char* const arguments[] = {command.data(), from.data(), to.data(), nullptr};
  pid_t child;
  if (posix_spawnp(&child, "cp", nullptr, nullptr, arguments, environ) != 0) return false;
  int status;
  return waitpid(child, &status, 0) == child && status == 0;
}

// ext4 starts writing a truncated file to the disk when it is closed (auto_da_alloc), and copyFile
// truncates the file that it has made. cp truncates only a file that exists.
bool copyWithCpOver(const std::string& source, const std::string& destination) {
  const int made = open(destination.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  return made != -1 && close(made) == 0 && copyWithCp(source, destination);
}

bool copyWithCopyFile(const std::string& source, const std::string& destination) {
  std::string to = destination;
  std::string user = owner().user;
  std::string group = owner().group;
  return copyFile(source.c_str(), to.data(), user.data(), group.data(), kMode);
}

// Larger than copyFile's own blocks, which fit on a small stack.
constexpr size_t kBlockBytes = 64 * 1024;

// The calls that copyFile makes for a new destination, in its order.
bool copyBare(const std::string& source, const std::string& destination) {
  struct stat64 status;
  for (int question = 0; question < 3; ++question) (void)stat64(source.c_str(), &status);
  for (int question = 0; question < 4; ++question) (void)stat64(destination.c_str(), &status);
  (void)umask(026);
  const int made = open64(destination.c_str(), O_RDWR | O_CREAT, 0640);
  if (made == -1) return false;
  const passwd* account = getpwnam(owner().user.c_str());
  const uid_t uid = account->pw_uid;
  account = getpwnam(owner().user.c_str());
  const group* const primary = getgrnam(owner().group.c_str());
  const bool owned =
      account != nullptr && fchown(made, uid, primary->gr_gid) == 0 && fchmod(made, kMode) == 0;
  (void)close(made);
  const int from = open64(source.c_str(), O_RDONLY);
  const int to = open64(destination.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0666);
  ssize_t copied = 1;
  while (copied > 0) copied = copy_file_range(from, nullptr, to, nullptr, 1024 * kMiB, 0);
  static char block[kBlockBytes];
  while ((copied = read(from, block, sizeof block)) > 0) {
    if (write(to, block, static_cast<size_t>(copied)) != copied) break;
  }
  (void)close(from);
  (void)close(to);
  return owned && copied == 0;
}

using Copy = bool (*)(const std::string&, const std::string&);

void copyTo(const std::filesystem::path& target, benchmark::State& state, Copy copyOnce) {
  const std::filesystem::path directory = std::filesystem::temp_directory_path();
  const uintmax_t bytes = static_cast<uintmax_t>(state.range(0)) * kMiB;
  const std::string source = directory / ("source" + std::to_string(state.range(0)));
  const std::string destination = target / "osutils-bench-copy";
  if (owner().user.empty()) return unavailable(state, "the current user has no account");
  for (const std::filesystem::path& place : {directory, target}) {
    if (std::filesystem::space(place).available < 4 * bytes) {
      return unavailable(state, "too little free space in " + place.string());
    }
  }
  if (!std::filesystem::exists(source) && !makeSource(source, bytes)) {
    return state.SkipWithError("cannot make the source file");
  }
  trcEvents = 0;
  for (auto _ : state) {
    const bool complete = copyOnce(source, destination);
    state.PauseTiming();
    if (!complete || std::filesystem::file_size(destination) != bytes) {
      return state.SkipWithError("the copy is not complete");
    }
    std::filesystem::remove(destination);
    state.ResumeTiming();
  }
}

void copy(benchmark::State& state, Copy copyOnce) {
  copyTo(std::filesystem::temp_directory_path(), state, copyOnce);
}

void copyAcross(benchmark::State& state, Copy copyOnce) {
  const char* const target = "/dev/shm";
  struct stat64 here;
  struct stat64 there;
  if (stat64(std::filesystem::temp_directory_path().c_str(), &here) != 0 ||
      stat64(target, &there) != 0 || here.st_dev == there.st_dev) {
    return unavailable(state, "/dev/shm is on the same file system");
  }
  copyTo(target, state, copyOnce);
}

// cp runs in another process, so elapsed time is compared.
void large(benchmark::internal::Benchmark* benchmark) {
  benchmark->Arg(1024)->Iterations(1)->UseRealTime()->Unit(benchmark::kMillisecond);
}
BENCHMARK_CAPTURE(copy, copyFile, copyWithCopyFile)->Name("copy_large/copyFile")->Apply(large);
BENCHMARK_CAPTURE(copy, cp_over, copyWithCpOver)->Name("copy_large/cp_over")->Apply(large);
BENCHMARK_CAPTURE(copy, cp, copyWithCp)->Name("copy_large/cp")->Apply(large);

void small(benchmark::internal::Benchmark* benchmark) {
  benchmark->Arg(1)->Unit(benchmark::kMicrosecond);
}
BENCHMARK_CAPTURE(copy, copyFile, copyWithCopyFile)->Name("copy_small/copyFile")->Apply(small);
BENCHMARK_CAPTURE(copy, bare, copyBare)->Name("copy_small/bare")->Apply(small);

void across(benchmark::internal::Benchmark* benchmark) {
  benchmark->Arg(16)->Unit(benchmark::kMicrosecond);
}
BENCHMARK_CAPTURE(copyAcross, copyFile, copyWithCopyFile)
    ->Name("copy_across/copyFile")
    ->Apply(across);
BENCHMARK_CAPTURE(copyAcross, blocks, copyBare)->Name("copy_across/blocks")->Apply(across);

}  // namespace
