// The debug text as a line of spdlog, in a file on the trace's file system.
#include <benchmark/benchmark.h>
#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/spdlog.h>

#include <string>

namespace {

void logLine(benchmark::State& state) {
  const std::string path = "/dev/shm/osutils-bench-spdlog." + std::to_string(getpid());
  {
    spdlog::logger logger("bench", std::make_shared<spdlog::sinks::basic_file_sink_mt>(path, true));
    for (auto _ : state) {
      logger.info("getEnvVar: the value of '{}' is found at position {}.", "LDAPHOME", 12);
    }
  }
  (void)unlink(path.c_str());
}
BENCHMARK(logLine)->Name("debug/spdlog")->Iterations(200'000);
BENCHMARK(logLine)->Name("latest_debug/spdlog")->Iterations(200'000);

}  // namespace
