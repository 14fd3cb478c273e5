// Loading and unloading the library compared with mapping a file of its size. This program is not
// linked to the library, but to the platform libraries, so that they are loaded already.
#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

bool isLoaded() {
  void* const handle = dlopen(BENCH_OSUTILS, RTLD_NOW | RTLD_NOLOAD);
  if (handle != nullptr) (void)dlclose(handle);
  return handle != nullptr;
}

void loadAndUnload(benchmark::State& state) {
  if (isLoaded()) return state.SkipWithError("the library was loaded before the measurement");
  for (auto _ : state) {
    void* const handle = dlopen(BENCH_OSUTILS, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) return state.SkipWithError(dlerror());
    (void)dlclose(handle);
  }
}
BENCHMARK(loadAndUnload)->Name("load/dlopen");

void unload(benchmark::State& state) {
  for (auto _ : state) {
    void* const handle = dlopen(BENCH_OSUTILS, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) return state.SkipWithError(dlerror());
    (void)dlclose(handle);
  }
  state.counters["stays_loaded"] = isLoaded();
}
BENCHMARK(unload)->Name("unload/dlclose")->Iterations(1);

void mapAndUnmap(benchmark::State& state) {
  const long page_bytes = sysconf(_SC_PAGESIZE);
  for (auto _ : state) {
    const int file = open(BENCH_OSUTILS, O_RDONLY | O_CLOEXEC);
    struct stat status;
    if (file == -1 || fstat(file, &status) != 0)
      return state.SkipWithError("cannot open the library");
    const size_t bytes = static_cast<size_t>(status.st_size);
    void* const mapping = mmap(nullptr, bytes, PROT_READ, MAP_PRIVATE, file, 0);
    if (mapping == MAP_FAILED) return state.SkipWithError("cannot map the library");
    char sum = 0;
    for (size_t at = 0; at < bytes; at += static_cast<size_t>(page_bytes)) {
      sum = static_cast<char>(sum ^ static_cast<const volatile char*>(mapping)[at]);
    }
    benchmark::DoNotOptimize(sum);
    (void)munmap(mapping, bytes);
    (void)close(file);
  }
}
BENCHMARK(mapAndUnmap)->Name("load/map");

}  // namespace
