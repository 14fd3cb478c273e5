// What the frame costs while tracing is off.
#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <stdlib.h>
#include <sys/stat.h>

#include "ldtr.h"
#include "osutils.h"
#include "platform.h"
#include "unavailable.h"

namespace {

constexpr const char kVariable[] = "OSUTILS_BENCH_VARIABLE";
constexpr const char kValue[] = "/opt/directory/server";
constexpr const char kExistingFile[] = "/etc/passwd";

void prepareEnvironment(const benchmark::State&) {
  trcEvents = 0;
  (void)setenv(kVariable, kValue, 1);
}

void getEnvVarOfASetVariable(benchmark::State& state) {
  for (auto _ : state) {
    const char* name = kVariable;
    benchmark::DoNotOptimize(name);
    char* const value = getEnvVar(name);
    benchmark::DoNotOptimize(value);
    free(value);
  }
}
BENCHMARK(getEnvVarOfASetVariable)->Name("environment/getEnvVar")->Setup(prepareEnvironment);

void platformGetenvAndNullTest(benchmark::State& state) {
  for (auto _ : state) {
    const char* name = kVariable;
    benchmark::DoNotOptimize(name);
    char* const value = name == nullptr ? nullptr : ldap_getenv(name);
    benchmark::DoNotOptimize(value);
    free(value);
  }
}
BENCHMARK(platformGetenvAndNullTest)->Name("environment/ldap_getenv")->Setup(prepareEnvironment);

// Calls the functions of both libraries through a pointer.
void call(benchmark::State& state, const char* library, const char* function) {
  void* const handle = dlopen(library, RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) return unavailable(state, dlerror());
  if (void* const check = dlsym(handle, "tracepoints_are_off");
      check != nullptr && !reinterpret_cast<bool (*)()>(check)()) {
    return unavailable(state, "a session has enabled the tracepoints");
  }
  auto* const called = reinterpret_cast<int (*)(int)>(dlsym(handle, function));
  if (called == nullptr) return state.SkipWithError(dlerror());
  trcEvents = 0;
  int argument = 1;
  for (auto _ : state) {
    benchmark::DoNotOptimize(argument);
    int result = called(argument);
    benchmark::DoNotOptimize(result);
  }
}
BENCHMARK_CAPTURE(call, without, BENCH_FRAMES, "without_frame")->Name("frame/without");
BENCHMARK_CAPTURE(call, with, BENCH_FRAMES, "with_frame")->Name("frame/with");
BENCHMARK_CAPTURE(call, with, BENCH_FRAMES, "with_frame")->Name("tracepoints_off/frame");
BENCHMARK_CAPTURE(call, lttng, BENCH_LTTNG, "with_tracepoints_off")->Name("tracepoints_off/lttng");

void doesFileExistOfAFile(benchmark::State& state) {
  trcEvents = 0;
  for (auto _ : state) {
    bool exists = doesFileExist(kExistingFile);
    benchmark::DoNotOptimize(exists);
  }
}
BENCHMARK(doesFileExistOfAFile)->Name("query/doesFileExist");

void statOfAFile(benchmark::State& state) {
  for (auto _ : state) {
    struct stat64 status;
    bool exists = stat64(kExistingFile, &status) == 0;
    benchmark::DoNotOptimize(exists);
  }
}
BENCHMARK(statOfAFile)->Name("query/stat64");

}  // namespace
