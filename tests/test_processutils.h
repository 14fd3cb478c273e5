// Fixture of the tests of processes.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/sched.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <string_view>

#include "osutils.h"
#include "process_namespace.h"
#include "world.h"

constexpr std::string_view kMetaCharacters = "&;`'\"|*?~<>^()[]{}$\n\r\\";
static_assert(kMetaCharacters.size() == 22);

// Runs the body in a child process: the results of the platform checks are kept until the process
// ends.
inline void inChildExpecting(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

// Creates a program with this shell script and returns its path.
inline std::string program(const TempDir& place, const std::string& name,
                           const std::string& script) {
  const std::string path = place.file(name, "#!/bin/sh\n" + script);
  EXPECT_EQ(chmod(path.c_str(), 0755), 0) << path;
  return path;
}

// Puts the directory first in PATH.
inline void searchFirst(const TempDir& place) {
  const char* const usual = getenv("PATH");
  const std::string path = place.path() + ":" + (usual != nullptr ? usual : "/usr/bin:/bin");
  ASSERT_EQ(setenv("PATH", path.c_str(), 1), 0);
}

// Returns what is written to standard output and standard error during the body.
inline std::string outputDuring(const std::function<void()>& body) {
  const TempDir temp;
  const std::string path = temp.file("output", "");
  fflush(nullptr);
  const int out = dup(STDOUT_FILENO);
  const int err = dup(STDERR_FILENO);
  const int file = open(path.c_str(), O_WRONLY | O_APPEND);
  EXPECT_TRUE(out != -1 && err != -1 && file != -1);
  dup2(file, STDOUT_FILENO);
  dup2(file, STDERR_FILENO);
  body();
  fflush(nullptr);
  dup2(out, STDOUT_FILENO);
  dup2(err, STDERR_FILENO);
  close(out);
  close(err);
  close(file);
  return contentsOf(path);
}

inline std::string launchMessage(const std::string& dir, const std::string& arguments) {
  return "D startProcess: command='" + dir + "/vrarun " + arguments + " > /dev/null 2>&1'.\n";
}

// ---- Test processes ----

// Another process with this name (its first 15 characters) and, if not 0, this id. It waits until it
// is stopped and ends with the test at the latest.
class Other {
 public:
  explicit Other(const std::string& name, pid_t id = 0) {
    int ready[2];
    if (pipe(ready) == -1) {
      ADD_FAILURE() << "pipe: " << strerror(errno);
      return;
    }
    clone_args arguments = {};
    arguments.exit_signal = SIGCHLD;
    if (id != 0) {
      arguments.set_tid = reinterpret_cast<uintptr_t>(&id);
      arguments.set_tid_size = 1;
    }
    // The child makes only system calls: it was not created by fork().
    id_ = static_cast<pid_t>(syscall(SYS_clone3, &arguments, sizeof arguments));
    if (id_ == 0) {
      syscall(SYS_prctl, PR_SET_PDEATHSIG, SIGKILL, 0, 0, 0);
      syscall(SYS_prctl, PR_SET_NAME, name.c_str(), 0, 0, 0);
      syscall(SYS_close, ready[0]);
      syscall(SYS_close, ready[1]);
      for (;;) syscall(SYS_ppoll, nullptr, 0, nullptr, nullptr, 0);
    }
    EXPECT_NE(id_, -1) << "clone3: " << strerror(errno);
    close(ready[1]);
    char none;
    EXPECT_EQ(read(ready[0], &none, 1), 0);  // end of file: the name is set
    close(ready[0]);
  }
  ~Other() {
    stop();
    collect();
  }
  Other(const Other&) = delete;
  Other& operator=(const Other&) = delete;

  pid_t id() const { return id_; }
  std::string text() const { return std::to_string(id_); }
  bool isAlive() const {
    siginfo_t info = {};
    return waitid(P_PID, static_cast<id_t>(id_), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == 0;
  }
  // Kills it and leaves a zombie.
  void stop() const {
    if (id_ <= 0) return;
    kill(id_, SIGKILL);
    siginfo_t info = {};
    EXPECT_EQ(waitid(P_PID, static_cast<id_t>(id_), &info, WEXITED | WNOWAIT), 0);
  }
  // Waits for its end and returns the wait status.
  int collect() {
    int status = -1;
    if (id_ > 0) waitpid(id_, &status, 0);
    id_ = -1;
    return status;
  }

 private:
  pid_t id_ = -1;
};
