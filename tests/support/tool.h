// The command-line tool, run as a child process.
#pragma once

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "world.h"

using Arguments = std::vector<std::string>;

struct Result {
  int status = -1;  // 1000 + the signal if one ended the program
  std::string out;
  std::string err;
};

inline std::string readAll(int descriptor) {
  std::string text;
  char buffer[4096];
  for (ssize_t size; (size = read(descriptor, buffer, sizeof buffer)) > 0;) {
    text.append(buffer, static_cast<size_t>(size));
  }
  close(descriptor);
  return text;
}

// Runs a program. `prepare` is called in the child with its standard streams in place.
inline Result runProgram(
    Arguments arguments, const std::function<void()>& prepare = [] {}) {
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  int out[2];
  int err[2];
  if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) return {};

  const pid_t child = fork();
  if (child == 0) {
    dup2(out[1], STDOUT_FILENO);
    dup2(err[1], STDERR_FILENO);
    for (const char* name :
         {"TRC_DIR", "TRC_EVENTS", "TRC_MAX_BYTES", "TRC_MODE", "PRINT_DEBUG", "VRA_LDAP_HOME"}) {
      unsetenv(name);
    }
    prepare();
    execv(argv[0], argv.data());
    _exit(126);
  }
  close(out[1]);
  close(err[1]);
  Result result;
  result.out = readAll(out[0]);
  result.err = readAll(err[0]);  // fits into the pipe's buffer while `out` is read
  int status = 0;
  waitpid(child, &status, 0);
  result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
  return result;
}

inline Result osutils(
    Arguments arguments, const std::function<void()>& prepare = [] {}) {
  arguments.insert(arguments.begin(), OSUTILS_TOOL);
  return runProgram(std::move(arguments), prepare);
}

// For programs that may not write their coverage counters.
inline void dropCoverageCounters() {
  setenv("GCOV_PREFIX", "/dev/null", 1);
  setenv("GCOV_ERROR_FILE", "/dev/null", 1);
}

// Makes writes beyond this size fail, as on a full disk.
inline void limitFileSize(rlim_t bytes) {
  const rlimit limit{bytes, bytes};
  setrlimit(RLIMIT_FSIZE, &limit);
  dropCoverageCounters();
}

inline void expectAnswer(const Result& result, const std::string& out) {
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.out, out);
  EXPECT_EQ(result.err, "");
}

// The answer "no".
inline void expectNo(const Result& result, const std::string& out) {
  EXPECT_EQ(result.status, 1);
  EXPECT_EQ(result.out, out);
  EXPECT_EQ(result.err, "");
}

// Wrong usage or a failure, reported in one line.
inline void expectFailure(const Result& result, const ::testing::Matcher<std::string>& line) {
  const bool is_usage = result.err.find(": parameter error (89): ") != std::string::npos;
  EXPECT_EQ(result.status, is_usage ? 2 : 3);
  EXPECT_EQ(result.out, "");
  EXPECT_THAT(result.err, line);
  EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
}

inline bool othersMayRunTheTool() {
  return asUser(kNobody, [] { return access(OSUTILS_TOOL, X_OK) == 0 ? 0 : 1; }) == 0;
}

#define REQUIRE_OTHER_USERS()             \
  REQUIRE_ROOT("to become another user"); \
  if (!othersMayRunTheTool()) GTEST_SKIP() << "the build directory is closed to other users"

// Runs the body as nobody.
inline void asNobody(const std::function<void()>& body) {
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     body();
                     return ::testing::Test::HasFailure() ? 1 : 0;
                   }),
            0);
}
