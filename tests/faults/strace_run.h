// Runs a program under strace, which makes one of its system calls fail or kills it there.
#pragma once

#include <set>
#include <string>
#include <vector>

using Words = std::vector<std::string>;

// Strikes at the nth call of this system call.
struct Injection {
  std::string call;
  std::string effect;  // as strace takes it: "error=EIO"
  int nth;
  bool shows_stack = false;
};

struct Ended {
  int status = -1;  // 1000 + the signal if one ended the program
  std::string out;
  std::string err;
  std::string struck;           // strace's line of the call, or "killed"; may be empty
  std::set<std::string> calls;  // the names of all system calls, without an injection
  std::string stack;            // of that call, if the injection shows it
  bool is_late = false;         // ended only by the driver, after a time limit
  std::string problem;          // a strace that did not do its work
};

inline const char* const kKill = "signal=KILL";
constexpr int kKilled = 1009;

// Runs the program, which stops itself with SIGSTOP once, under strace from there on. Its files are in
// the directory. The caller is the first process of a process namespace; all others end.
Ended runUnderStrace(const Words& program, const Words& environment, const std::string& directory,
                     const Injection* injection);

// Runs the program without strace.
Ended run(const Words& program, const Words& environment, const std::string& directory,
          const std::string& input = "/dev/null");
