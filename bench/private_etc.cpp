#include "private_etc.h"

#include <errno.h>
#include <sched.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>

#include <filesystem>
#include <fstream>

namespace {

std::string failed(const std::string& what) { return what + ": " + strerror(errno); }

std::string makeEtcPrivate() {
  if (unshare(CLONE_NEWNS) != 0) return failed("a private /etc needs root");
  // Fails in a chroot whose / is not a mount point; `./dev bench` has made the mounts private.
  if (getenv("OSUTILS_BENCH_PRIVATE_MOUNTS") == nullptr &&
      mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    return failed("cannot make the mounts private");
  }
  const std::filesystem::path replacement = std::filesystem::temp_directory_path() / "etc";
  std::filesystem::create_directory(replacement);
  if (mount(replacement.c_str(), "/etc", nullptr, MS_BIND, nullptr) != 0) {
    return failed("cannot mount a private /etc");
  }
  return "";
}

}  // namespace

std::string writeToPrivateEtc(const std::string& name, const std::string& content) {
  static const std::string why_not = makeEtcPrivate();
  if (!why_not.empty()) return why_not;
  if (!(std::ofstream("/etc/" + name) << content).flush()) return failed("cannot write " + name);
  return "";
}
