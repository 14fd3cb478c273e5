// Files, users and mounts for one test: everything is private to it and gone when the scope ends.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <string_view>

// A new empty directory (mode 0755), removed with all it holds at the end of the scope.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  // The name below the directory; nothing is made.
  std::string path(std::string_view name) const;
  // Makes a file with these contents (mode 0644) and returns its path.
  std::string file(std::string_view name, std::string_view contents) const;
  // Makes a directory and returns its path.
  std::string dir(std::string_view name) const;

 private:
  std::string path_;
};

std::string contentsOf(const std::string& path);
void writeFile(const std::string& path, std::string_view contents);
bool pathExists(const std::string& path);      // without following a link
unsigned int modeOf(const std::string& path);  // permission bits
int openDescriptors();                         // how many descriptors this process has open

constexpr uid_t kNobody = 65534;

// Each runs `body` in a child process and returns its result (0 to 255), or -1 and a test failure
// when the child did not exit normally. A gtest assertion that fails in the child is printed by it
// and makes the result 99. The child writes its coverage counters and does not run the parent's
// cleanups. A leak that a sanitizer finds in the child makes the result 99 as well.
int inChild(const std::function<int()>& body);
// ... as another user, with no supplementary groups. Needs root.
int asUser(uid_t uid, const std::function<int()>& body);
// ... with a mount table of its own, in which /etc is a private writable copy of itself and the
// files there are the only source of accounts, services and hosts. Needs root.
int withPrivateEtc(const std::function<int()>& body);
// ... likewise, and with a host name and a network of its own: a loopback interface that is down and
// has no address, and no way out. Needs root.
int withPrivateNetwork(const std::function<int()>& body);
// ... with a mount table of its own only, for instance for a small tmpfs. Needs root.
int withPrivateMounts(const std::function<int()>& body);

// Whether terminals can be made. In a chroot, devpts may not be mounted.
bool hasTerminals();

struct Terminal {
  int manager;     // the side of a program like xterm
  int subsidiary;  // the side of the programs that run in it
};
Terminal openTerminal();

// Skips the current test, with a reason, unless it runs as root.
#define REQUIRE_ROOT(why) \
  if (geteuid() != 0) GTEST_SKIP() << "needs root " << (why)
