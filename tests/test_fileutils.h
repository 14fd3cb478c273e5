// Fixture of the tests of file operations.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <utility>

#include "files.h"
#include "osutils.h"
#include "records.h"
#include "traced_test.h"
#include "trails.h"
#include "world.h"

// ---- Expected records ----

// Both queries of a path in a directory that may not be searched.
inline Trail hidden() {
  return joined(query("doesFileExist", 0, EACCES), query("canAccessFile", 0, EACCES));
}

inline gid_t ownGroup() {
  const passwd* const user = getpwuid(getuid());
  return user == nullptr ? 0 : user->pw_gid;
}

inline Trail writable() { return call("canWriteToFile", 1, no("isDirectory")); }

// ---- Fixture ----

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

inline void makeHardLink(const std::string& file, const std::string& name) {
  EXPECT_EQ(link(file.c_str(), name.c_str()), 0) << name;
}
inline void makeFifo(const std::string& path) { EXPECT_EQ(mkfifo(path.c_str(), 0666), 0) << path; }

inline std::string randomBytes(size_t size) {
  std::string bytes(size, '\0');
  std::minstd_rand next(static_cast<unsigned>(size) + 1);
  for (char& byte : bytes) byte = static_cast<char>(next());
  return bytes;
}

// Writes the bytes to the pipe in a thread, and tells whether all of them could be written.
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

struct Free {
  void operator()(char* memory) const { free(memory); }
};
using Buffer = std::unique_ptr<char, Free>;

// The value of an output before a call that must not change it.
inline char untouched[] = "untouched";
