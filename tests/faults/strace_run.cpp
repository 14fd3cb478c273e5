#include "strace_run.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <string_view>

namespace {

// Milliseconds. The tool waits up to 15 s for a lock.
constexpr int kTimeLimit = 30'000;
// strace leaves a descriptor open whose close() it lets fail, unlike the kernel. So a reader may wait
// for the end of a pipe.
constexpr int kTimeLimitOfClose = 3'000;

[[noreturn]] void stop(const char* what) {
  perror(what);
  _exit(2);
}

std::string contentsOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(file), {});
}

void redirect(const std::string& path, int flags, int descriptor) {
  const int opened = open(path.c_str(), flags | O_CLOEXEC, 0600);
  if (opened == -1 || dup2(opened, descriptor) == -1) stop(path.c_str());
}

std::vector<char*> pointersTo(Words& words) {
  std::vector<char*> pointers;
  for (std::string& word : words) pointers.push_back(word.data());
  pointers.push_back(nullptr);
  return pointers;
}

pid_t start(Words program, const Words& environment, const std::string& directory,
            const std::string& input) {
  std::vector<char*> argv = pointersTo(program);
  const pid_t child = fork();
  if (child == -1) stop("fork");
  if (child != 0) return child;
  redirect(input, O_RDONLY, STDIN_FILENO);
  redirect(directory + "/out", O_WRONLY | O_CREAT | O_TRUNC, STDOUT_FILENO);
  redirect(directory + "/err", O_WRONLY | O_CREAT | O_TRUNC, STDERR_FILENO);
  for (const std::string& setting : environment) {
    if (putenv(strdup(setting.c_str())) != 0) stop("putenv");
  }
  execv(argv[0], argv.data());
  stop(argv[0]);
}

// Returns false if the process has not ended within the time.
bool waitForEnd(pid_t process, int time_limit, int& status) {
  const int descriptor = static_cast<int>(syscall(SYS_pidfd_open, process, 0));
  if (descriptor == -1) stop("pidfd_open");
  pollfd wanted = {descriptor, POLLIN, 0};
  const bool has_ended = poll(&wanted, 1, time_limit) == 1;
  close(descriptor);
  if (!has_ended) kill(process, SIGKILL);
  if (waitpid(process, &status, 0) != process) stop("waitpid");
  return has_ended;
}

void noteEnd(Ended& ended, pid_t process, int time_limit, const std::string& directory) {
  int status = 0;
  ended.is_late = !waitForEnd(process, time_limit, status);
  ended.status = WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
  ended.out = contentsOf(directory + "/out");
  ended.err = contentsOf(directory + "/err");
}

struct Strace {
  pid_t process;
  int messages;
};

void waitUntilItTraces(const Strace& strace) {
  std::string text;
  char buffer[512];
  while (text.find(" attached\n") == std::string::npos) {
    const ssize_t size = read(strace.messages, buffer, sizeof buffer);
    if (size <= 0) {
      fprintf(stderr, "%s", text.c_str());
      stop("strace");
    }
    text.append(buffer, static_cast<size_t>(size));
  }
}

Strace startStrace(pid_t process, const std::string& log, const Injection* injection) {
  Words words = {"strace", "-s", "64", "-e", "signal=KILL", "-o", log};
  if (injection != nullptr) {
    if (injection->shows_stack) words.emplace_back("-k");
    words.insert(words.end(), {"-e", "trace=" + injection->call, "-e",
                               "inject=" + injection->call + ":" + injection->effect +
                                   ":when=" + std::to_string(injection->nth)});
  }
  words.insert(words.end(), {"-p", std::to_string(process)});
  std::vector<char*> argv = pointersTo(words);
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) stop("pipe");
  const pid_t child = fork();
  if (child == -1) stop("fork");
  if (child == 0) {
    dup2(ends[1], STDERR_FILENO);
    execvp(argv[0], argv.data());
    stop("strace");
  }
  close(ends[1]);
  return {child, ends[0]};
}

// Processes that the program has left behind keep strace running. They and strace end here.
// Returns false if something else ended strace.
bool end(const Strace& strace) {
  int status = 0;
  bool has_ended = false;
  for (int tries = 0; tries < 1000 && !has_ended; ++tries) {
    has_ended = waitpid(strace.process, &status, WNOHANG) == strace.process;
    if (!has_ended) usleep(500);
  }
  kill(-1, SIGKILL);
  while (waitpid(-1, nullptr, 0) > 0) {
  }
  close(strace.messages);
  return !has_ended || !WIFSIGNALED(status);
}

// The name in "openat(…"; empty for other lines.
std::string callIn(std::string_view line) {
  const size_t length = line.find_first_not_of("abcdefghijklmnopqrstuvwxyz_0123456789");
  if (length == 0 || length == std::string_view::npos || line[length] != '(') return "";
  return std::string(line.substr(0, length));
}

void readLog(const std::string& path, bool is_kill, Ended& ended) {
  std::ifstream log(path);
  bool is_struck = false;  // the last call
  for (std::string line; std::getline(log, line);) {
    if (const std::string call = callIn(line); !call.empty()) {
      ended.calls.insert(call);
      is_struck = line.ends_with("(INJECTED)");
      if (is_struck) ended.struck = line;
    }
    if (is_struck && line.starts_with(" > ")) ended.stack += line + "\n";
    if (is_kill && line.ends_with("+++ killed by SIGKILL +++")) ended.struck = "killed";
  }
}

}  // namespace

Ended run(const Words& program, const Words& environment, const std::string& directory,
          const std::string& input) {
  Ended ended;
  noteEnd(ended, start(program, environment, directory, input), kTimeLimit, directory);
  return ended;
}

Ended runUnderStrace(const Words& program, const Words& environment, const std::string& directory,
                     const Injection* injection) {
  Ended ended;
  const std::string log = directory + "/log";
  const pid_t process = start(program, environment, directory, "/dev/null");
  int status = 0;
  if (waitpid(process, &status, WUNTRACED) != process || !WIFSTOPPED(status)) {
    ended.problem = "ended before it stopped itself: " + contentsOf(directory + "/err");
    return ended;
  }
  const Strace strace = startStrace(process, log, injection);
  waitUntilItTraces(strace);
  kill(process, SIGCONT);
  const bool is_close = injection != nullptr && injection->call == "close";
  noteEnd(ended, process, is_close ? kTimeLimitOfClose : kTimeLimit, directory);
  if (!end(strace)) ended.problem = "strace was killed";
  readLog(log, injection != nullptr && injection->effect == kKill, ended);
  return ended;
}
