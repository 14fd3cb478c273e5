// Isolates tests that signal processes.
#pragma once

#include <errno.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <stdio.h>
#include <string.h>
#include <sys/mount.h>
#include <unistd.h>

#include <functional>

#include "world.h"

// Runs the body as the first process of a process namespace, with the /proc of that namespace, and in
// a process group of its own: kill(-1) and kill(0) reach nothing outside.
inline void inProcessNamespace(const std::function<void()>& body) {
  EXPECT_EQ(
      withPrivateMounts([&]() -> int {
        if (unshare(CLONE_NEWPID) == -1) {
          ADD_FAILURE() << "unshare: " << strerror(errno);
          return 1;
        }
        const int result = inChild([&] {
          if (getpid() != 1 || setsid() == -1 || mount("proc", "/proc", "proc", 0, nullptr) != 0) {
            ADD_FAILURE() << "cannot be alone: " << strerror(errno);
            return 1;
          }
          body();
          return 0;
        });
        // LeakSanitizer cannot fork any more: the namespace has lost its first process.
        fflush(nullptr);
        _exit(result);
      }),
      0);
}

#define REQUIRE_PROCESS_NAMESPACE() REQUIRE_ROOT("for a process namespace of its own")

// Above the highest process number of the system.
inline constexpr int kNoProcess = 2147483647;
