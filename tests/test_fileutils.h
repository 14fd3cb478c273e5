// Fixture of the tests of file operations.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <utility>

#include "calls.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

// ---- Expected records ----

inline Trail debug(const std::string& text) { return {"D " + text + "\n"}; }
inline Trail error(const std::string& text) { return {"E " + text + "\n"}; }

// A query whose stat() fails.
inline Trail query(const std::string& name, long code, int error_number) {
  return call(name, code, debug(name + ": stat() - errno=" + std::to_string(error_number)));
}
// Both queries of a path that does not exist.
inline Trail missing() {
  return joined(query("doesFileExist", 0, ENOENT), query("canAccessFile", 1, ENOENT));
}
// Both queries of a path in a directory that may not be searched.
inline Trail hidden() {
  return joined(query("doesFileExist", 0, EACCES), query("canAccessFile", 0, EACCES));
}

inline gid_t ownGroup() {
  const passwd* const user = getpwuid(getuid());
  return user == nullptr ? 0 : user->pw_gid;
}

inline Trail ownAccount() {
  const std::string gid = std::to_string(ownGroup());
  return joined(debug("vra_get_uid: name=NULL uid=" + std::to_string(getuid())),
                debug("vra_get_usr_gid: name=NULL gid=" + gid),
                debug("vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid));
}
inline Trail givenToOwnAccount() { return call("setFileOwnersAndPermissions", 1, ownAccount()); }
inline Trail createdForOwnAccount() {
  return call("createFile", 1, missing(), givenToOwnAccount());
}
inline Trail deleted() { return call("deleteFile", 1, no("isDirectory")); }
inline Trail writable() { return call("canWriteToFile", 1, no("isDirectory")); }

// ---- Fixture ----

class Umask {
 public:
  explicit Umask(mode_t mask) : before_(umask(mask)) {}
  ~Umask() { umask(before_); }
  Umask(const Umask&) = delete;
  Umask& operator=(const Umask&) = delete;

 private:
  mode_t before_;
};

inline mode_t currentUmask() {
  const mode_t mask = umask(0);
  umask(mask);
  return mask;
}

// Sets the permission bits of a path until the end of the scope.
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

// Runs the body in a child process that is not root: permission bits do not stop root.
inline int asOrdinaryUser(const std::function<int()>& body) {
  return geteuid() == 0 ? asUser(kNobody, body) : inChild(body);
}

inline struct stat64 statusOf(const std::string& path) {
  struct stat64 status = {};
  EXPECT_EQ(lstat64(path.c_str(), &status), 0) << path;
  return status;
}

inline void makeLink(const std::string& target, const std::string& name) {
  EXPECT_EQ(symlink(target.c_str(), name.c_str()), 0) << name;
}
inline void makeHardLink(const std::string& file, const std::string& name) {
  EXPECT_EQ(link(file.c_str(), name.c_str()), 0) << name;
}
inline void makeFifo(const std::string& path) { EXPECT_EQ(mkfifo(path.c_str(), 0666), 0) << path; }
inline void makeSocket(const std::string& path) {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  path.copy(address.sun_path, path.size());
  const int socket_descriptor = socket(AF_UNIX, SOCK_STREAM, 0);
  EXPECT_EQ(bind(socket_descriptor, reinterpret_cast<sockaddr*>(&address), sizeof address), 0)
      << path;
  close(socket_descriptor);
}

inline std::string randomBytes(size_t size) {
  std::string bytes(size, '\0');
  std::minstd_rand next(static_cast<unsigned>(size) + 1);
  for (char& byte : bytes) byte = static_cast<char>(next());
  return bytes;
}

// Each test runs twice: with tracing on and with tracing off.
class FileTest : public testing::TestWithParam<bool> {
 protected:
  // Returns the records since the last call.
  Trail trail() {
    const Trail arrived = records_.trail();
    records_.clear();
    return arrived;
  }
  // The expected records: those of these calls, or none with tracing off.
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

// ---- copyFile ----

// Writes the bytes to the pipe in a thread, and tells whether all of them were read.
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

// Returns the descriptor of this process for the file, or -1.
inline int descriptorOf(const std::string& path) {
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    if (std::filesystem::read_symlink(entry.path(), gone) == path) {
      return std::stoi(entry.path().filename());
    }
  }
  return -1;
}
inline bool isOpenHere(const std::string& path) { return descriptorOf(path) != -1; }

// ---- readFile ----

struct Free {
  void operator()(char* memory) const { free(memory); }
};
using Buffer = std::unique_ptr<char, Free>;

// The value of an output before a call that must not change it.
inline char untouched[] = "untouched";
