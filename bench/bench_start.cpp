// The CPU time of starting the tool, beside a small program of the C library, and its memory for a large trace.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <spawn.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

#include "unavailable.h"

namespace {

double seconds(const timeval& time) {
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

// Returns what the last run of the command used.
rusage run(benchmark::State& state, std::vector<const char*> command) {
  rusage used = {};
  if (access(command[0], X_OK) != 0) {
    unavailable(state, command[0]);
    return used;
  }
  command.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  (void)posix_spawn_file_actions_init(&actions);
  (void)posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
  for (auto _ : state) {
    pid_t child;
    int status = 0;
    if (posix_spawn(&child, command[0], &actions, nullptr, const_cast<char**>(command.data()),
                    environ) != 0 ||
        wait4(child, &status, 0, &used) != child || status != 0) {
      state.SkipWithError("the program failed");
      break;
    }
    state.SetIterationTime(seconds(used.ru_utime) + seconds(used.ru_stime));
  }
  (void)posix_spawn_file_actions_destroy(&actions);
  return used;
}

void startTool(benchmark::State& state) { (void)run(state, {BENCH_TOOL, "--version"}); }
BENCHMARK(startTool)->Name("start/osutils")->UseManualTime()->Iterations(20);

void startGetent(benchmark::State& state) {
  (void)run(state, {"/usr/bin/getent", "passwd", "root"});
}
BENCHMARK(startGetent)->Name("start/getent")->UseManualTime()->Iterations(20);

// bench/run writes the trace.
void summarize(benchmark::State& state) {
  const char* const trace = getenv("BENCH_TRACE");
  if (trace == nullptr) return unavailable(state, "no BENCH_TRACE");
  const rusage used = run(state, {BENCH_TOOL, "trace", "summary", trace});
  state.counters["mib"] = static_cast<double>(used.ru_maxrss) / 1024;
}
BENCHMARK(summarize)->Name("summary/memory")->UseManualTime()->Iterations(1);

}  // namespace
