// Runs every command of the tool and every scenario under strace. Each system call from main or the
// call of the function on fails, with two errors, and is the point of a SIGKILL. Prints a table. Ends
// with 1 if it found anything.
#include <errno.h>
#include <sched.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <map>
#include <new>
#include <thread>

#include "private_network.h"
#include "strace_subjects.h"
#include "world.h"

namespace {

// ---- Errors ----

struct ErrorsOf {
  std::vector<const char*> calls;
  std::vector<const char*> effects;
};

// For the other calls: EIO and ENOMEM.
const ErrorsOf kErrors[] = {
    {{"open", "openat", "openat2", "dup", "dup2", "dup3", "pipe", "pipe2"},
     {"error=EMFILE", "error=EACCES"}},
    {{"read", "pread64", "readv"}, {"error=EIO", "error=EINTR"}},
    {{"write", "pwrite64", "writev", "ftruncate", "copy_file_range", "sendfile"},
     {"error=ENOSPC", "error=EIO"}},
    {{"close"}, {"error=EIO", "error=EINTR"}},
    {{"fsync", "fdatasync", "syncfs"}, {"error=EIO", "error=ENOSPC"}},
    {{"stat", "lstat", "fstat", "newfstatat", "statx", "statfs", "fstatfs", "access", "faccessat",
      "faccessat2", "readlink", "readlinkat", "getcwd", "chdir", "fchdir"},
     {"error=EIO", "error=EACCES"}},
    {{"mkdir", "mkdirat", "rmdir", "unlink", "unlinkat", "rename", "renameat", "renameat2",
      "symlink", "symlinkat", "link", "linkat"},
     {"error=EROFS", "error=EACCES"}},
    {{"chmod", "fchmod", "fchmodat", "chown", "lchown", "fchown", "fchownat"},
     {"error=EPERM", "error=EROFS"}},
    {{"fcntl", "flock"}, {"error=ENOLCK", "error=EINTR"}},
    {{"mmap", "mremap", "mprotect", "munmap"}, {"error=ENOMEM", "error=EAGAIN"}},
    {{"brk"}, {"retval=0"}},  // it returns the old end of the heap instead of an error
    {{"clone", "clone3", "fork", "vfork"}, {"error=EAGAIN", "error=ENOMEM"}},
    {{"execve", "execveat"}, {"error=ENOENT", "error=ENOMEM"}},
    {{"wait4", "waitid"}, {"error=ECHILD", "error=EINTR"}},
    {{"kill", "tgkill"}, {"error=EPERM", "error=ESRCH"}},
    {{"futex", "poll", "ppoll", "select", "pselect6"}, {"error=EAGAIN", "error=EINTR"}},
    {{"nanosleep", "clock_nanosleep"}, {"error=EINTR", "error=EINVAL"}},
    {{"socket"}, {"error=EMFILE", "error=EAFNOSUPPORT"}},
    {{"connect", "sendto", "sendmsg", "sendmmsg"}, {"error=ENETUNREACH", "error=ECONNREFUSED"}},
    {{"recvfrom", "recvmsg"}, {"error=ENOMEM", "error=EINTR"}},
    {{"bind"}, {"error=EADDRINUSE", "error=EACCES"}},
    {{"ioctl"}, {"error=ENODEV", "error=EIO"}},
    {{"exit", "exit_group", "getpid", "getppid", "gettid", "getuid", "geteuid", "getgid", "getegid",
      "umask", "alarm", "lseek", "rt_sigreturn", "restart_syscall"},
     {}},  // never fail; lseek not on files
};

std::vector<const char*> errorsOf(const std::string& call) {
  for (const ErrorsOf& errors : kErrors) {
    if (std::find(errors.calls.begin(), errors.calls.end(), call) != errors.calls.end()) {
      return errors.effects;
    }
  }
  return {"error=EIO", "error=ENOMEM"};
}

// Failures that the kernel does not know: the C library aborts after them, or a descriptor that is
// closed stays open.
bool isImpossible(const Ended& ended) {
  return ended.struck.starts_with("brk(NULL)") ||
         ended.struck.find("FUTEX_WAKE") != std::string::npos ||
         (ended.struck.starts_with("close(") && ended.is_late);
}

// ---- All calls of a subject ----

struct Row {
  int runs = 0;
  int kills = 0;
  std::vector<std::string> findings;
};

class Sweep {
 public:
  Sweep(const Subject& subject, std::string directory, std::string scratch)
      : subject_(subject), directory_(std::move(directory)), scratch_(std::move(scratch)) {}

  Row all() {
    good_ = runOnce(nullptr);
    state_ = subject_.state();
    judge("without a fault", good_);
    if (!row_.findings.empty()) return row_;
    for (const std::string& call : good_.calls) strikeEach(call);
    judge("without a fault at the end", runOnce(nullptr));
    return row_;
  }

 private:
  Ended runOnce(const Injection* injection) {
    std::filesystem::remove_all(directory_);
    std::filesystem::create_directory(directory_);
    subject_.prepare();
    return runUnderStrace(subject_.program, subject_.environment, scratch_, injection);
  }

  void judge(const std::string& where, const Ended& ended) {
    std::string finding = ended.is_late ? "still ran after the time limit" : ended.problem;
    if (finding.empty() && ended.status > 1000 &&
        (ended.status != kKilled || ended.struck != "killed")) {
      finding = "killed by " + std::string(strsignal(ended.status - 1000)) + " " + ended.err;
    }
    const bool is_judged = ended.status != kKilled || subject_.is_edit;
    if (finding.empty() && is_judged) finding = subject_.judge(ended, good_, state_);
    if (!finding.empty()) row_.findings.push_back(where + ": " + ended.struck + ": " + finding);
  }

  // Whether the scenario makes the call, not the library.
  bool isScenariosCall(Injection injection) {
    injection.shows_stack = true;
    const std::string stack = runOnce(&injection).stack;
    return !stack.empty() && stack.find("libosutils.so") == std::string::npos;
  }

  // Until a run makes fewer calls than would be needed.
  void strikeEach(const std::string& call) {
    for (int nth = 1;; ++nth) {
      bool has_struck = false;
      std::vector<const char*> effects = errorsOf(call);
      effects.push_back(kKill);
      for (const char* const effect : effects) {
        const Injection injection = {call, effect, nth};
        const Ended ended = runOnce(&injection);
        has_struck = !ended.struck.empty();
        if (!has_struck && ended.problem.empty() && !ended.is_late) break;
        if (isImpossible(ended)) continue;
        ++(effect == kKill ? row_.kills : row_.runs);
        const size_t findings = row_.findings.size();
        judge(call + " " + std::to_string(nth) + " " + effect, ended);
        if (row_.findings.size() != findings && subject_.is_function && effect != kKill &&
            isScenariosCall(injection)) {
          row_.findings.pop_back();
          --row_.runs;
        }
      }
      if (!has_struck) return;
    }
  }

  const Subject& subject_;
  const std::string directory_;
  const std::string scratch_;
  Ended good_;
  std::string state_;
  Row row_;
};

// ---- Processes of its own ----

[[noreturn]] void stop(const std::string& what) {
  fprintf(stderr, "strace_faults: %s: %s\n", what.c_str(), strerror(errno));
  exit(2);
}

// Runs the body as the first process of a process namespace, with a private /etc and network and an
// empty file system at the directory.
int apartFromOthers(const std::string& directory, const std::function<void()>& body) {
  return withPrivateNetwork([&] {
    if (unshare(CLONE_NEWPID) != 0) stop("unshare");
    return inChild([&] {
      if (getpid() != 1 || setsid() == -1) stop("process namespace");
      if (mount("proc", "/proc", "proc", 0, nullptr) != 0) stop("/proc");
      if (mount("osutils-test", directory.c_str(), "tmpfs", 0, "mode=0755") != 0) stop("tmpfs");
      startLoopback();
      umask(022);
      body();
      return 0;
    });
  });
}

// ---- All subjects ----

void runShare(const std::vector<Subject>& subjects, std::atomic<size_t>& next,
              const std::string& directory, const std::string& scratch, FILE* out) {
  for (size_t number; (number = next++) < subjects.size();) {
    const Row row = Sweep(subjects[number], directory, scratch).all();
    fprintf(out, "row %zu %d %d\n", number, row.runs, row.kills);
    for (std::string finding : row.findings) {
      std::replace(finding.begin(), finding.end(), '\n', '|');
      fprintf(out, "finding %zu %s\n", number, finding.c_str());
    }
    fflush(out);
  }
}

void readRows(FILE* out, std::map<size_t, Row>& rows) {
  rewind(out);
  char* line = nullptr;
  size_t capacity = 0;
  while (getline(&line, &capacity, out) > 0) {
    size_t number = 0;
    int runs = 0;
    int kills = 0;
    int text = 0;
    line[strcspn(line, "\n")] = '\0';
    if (sscanf(line, "row %zu %d %d", &number, &runs, &kills) == 3) {
      rows[number] = {runs, kills, {}};
    } else if (sscanf(line, "finding %zu %n", &number, &text) == 1) {
      rows[number].findings.emplace_back(line + text);
    }
  }
  free(line);
  fclose(out);
}

int printTable(const std::vector<Subject>& subjects, const std::map<size_t, Row>& rows) {
  struct Total {
    int runs = 0;
    int kills = 0;
    size_t findings = 0;
  };
  std::vector<std::string> order;
  std::map<std::string, Total> totals;
  Total sum;
  for (const auto& [number, row] : rows) {
    const std::string& name = subjects[number].row;
    if (!totals.contains(name)) order.push_back(name);
    for (Total* const total : {&totals[name], &sum}) {
      total->runs += row.runs;
      total->kills += row.kills;
      total->findings += row.findings.size();
    }
  }
  const auto print = [](const std::string& name, const Total& total) {
    printf("%-42s %6d %6d %8zu\n", name.c_str(), total.runs, total.kills, total.findings);
  };
  printf("%-42s %6s %6s %8s\n", "command or function", "faults", "kills", "findings");
  for (const std::string& name : order) print(name, totals[name]);
  print("all", sum);
  for (const auto& [number, row] : rows) {
    for (const std::string& finding : row.findings) {
      printf("FINDING %s: %s\n", subjects[number].name.c_str(), finding.c_str());
    }
  }
  return sum.findings == 0 ? 0 : 1;
}

int runAll(const std::vector<Subject>& subjects, const std::string& mount_point) {
  auto& next = *new (mmap(nullptr, sizeof(std::atomic<size_t>), PROT_READ | PROT_WRITE,
                          MAP_SHARED | MAP_ANONYMOUS, -1, 0)) std::atomic<size_t>(0);
  std::vector<FILE*> outputs;
  std::vector<pid_t> workers;
  for (unsigned int i = std::max(1U, std::thread::hardware_concurrency()); i != 0; --i) {
    outputs.push_back(tmpfile());
    if (outputs.back() == nullptr) stop("tmpfile");
    fflush(nullptr);
    const pid_t worker = fork();
    if (worker == -1) stop("fork");
    if (worker == 0) {
      _exit(apartFromOthers(mount_point, [&] {
        runShare(subjects, next, mount_point + "/run", mount_point, outputs.back());
      }));
    }
    workers.push_back(worker);
  }
  bool is_complete = true;
  for (const pid_t worker : workers) {
    int status = 0;
    if (waitpid(worker, &status, 0) != worker || status != 0) is_complete = false;
  }
  std::map<size_t, Row> rows;
  for (FILE* const out : outputs) readRows(out, rows);
  const int result = printTable(subjects, rows);
  is_complete = is_complete && rows.size() == subjects.size();
  if (!is_complete) printf("FINDING a process of the driver ended early\n");
  return is_complete ? result : 1;
}

}  // namespace

// strace_faults [--edits | NAME...]: only the editing commands, or only what has a name that begins so.
int main(int count, char** arguments) {
  if (getpid() != 1) {  // not yet where a call that goes wrong reaches nothing outside
    Words words = {APART};
    words.insert(words.end(), arguments, arguments + count);
    std::vector<char*> argv;
    for (std::string& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);
    execv(APART, argv.data());
    stop(APART);
  }
  const TempDir temp;
  const std::string directory = temp.path("run");
  std::vector<Subject> subjects = commandSubjects(directory, temp.path());
  int status = 0;
  for (const std::string& command : commandsWithoutSubject(subjects, temp.path())) {
    printf("FINDING nothing runs the command %s\n", command.c_str());
    status = 1;
  }
  const std::vector<Subject> functions = functionSubjects(directory, temp.path());
  subjects.insert(subjects.end(), functions.begin(), functions.end());
  const Words names(arguments + 1, arguments + count);
  if (!names.empty()) {
    std::erase_if(subjects, [&](const Subject& subject) {
      if (names == Words{"--edits"}) return !subject.is_edit;
      return std::none_of(names.begin(), names.end(),
                          [&](const std::string& name) { return subject.name.starts_with(name); });
    });
  }
  if (subjects.empty()) {
    fprintf(stderr, "strace_faults: nothing has this name\n");
    return 2;
  }
  return std::max(status, runAll(subjects, temp.path()));
}
