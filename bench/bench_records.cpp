// What a record costs while tracing is on, compared with a bare ring of the same bytes and LTTng-UST.
#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

#include "format.h"
#include "ldtr.h"
#include "mapped_ring.h"
#include "platform.h"
#include "trace_scope.h"
#include "trace_streams.h"
#include "unavailable.h"

namespace {

using osutils::traced::getEnvVar;

constexpr uint64_t kEntryType = ldtr_entry_type(33);
constexpr uint64_t kExitType = ldtr_exit_type(33);

thread_local MappedRing ring;

bool keepsLatest() { return getenv("TRC_MODE") != nullptr; }

// Fixed, because a trace grows. A repetition fills whole files of 4 MiB, or its share of the kernel's work for a file
// would vary: those of entry and exit records two, those of debug records four.
constexpr int kIterations = (8 << 20) / (2 * trc::kSmallBytes);
// More, because each repetition of two threads begins a stream, whose last file is filled only in part.
constexpr int kIterationsOfThreads = 4 * kIterations;

// Fails the benchmark if its records have fewer bytes than they should have: a trace that has stopped
// is fast. In a trace that keeps the latest records, overwritten ones count as much as those that were left out, but one
// that has stopped does not begin again.
class RecordedBytes {
 public:
  RecordedBytes(benchmark::State& state, size_t records_per_iteration, size_t bytes_of_record)
      : state_(state),
        records_(records_per_iteration),
        bytes_(bytes_of_record),
        before_(recordedTraceBytes(bytes_)) {}
  ~RecordedBytes() {
    const size_t expected = records_ * bytes_ * static_cast<size_t>(state_.iterations());
    const size_t after = recordedTraceBytes(bytes_);
    if (after - before_ < expected) state_.SkipWithError("records are missing");
    if (!keepsLatest()) return;
    const size_t present = recordedTraceBytes(0);
    trcWriteRec(kEntryType, getEnvVar.id, nullptr, 0, nullptr, 0, 0, 0, 0);
    if (recordedTraceBytes(0) == present) state_.SkipWithError("the trace has stopped");
  }
  RecordedBytes(const RecordedBytes&) = delete;
  RecordedBytes& operator=(const RecordedBytes&) = delete;

 private:
  benchmark::State& state_;
  size_t records_;
  size_t bytes_;
  size_t before_;
};

// Writes until the thread has its share of the bound, which bench/run sets, if the trace keeps the latest records: from
// then on its files are used again.
void writeShare(int threads) {
  if (!keepsLatest()) return;
  constexpr uint64_t kBoundBytes = 64 << 20;
  const uint64_t records = kBoundBytes / trc::kSmallBytes / static_cast<uint64_t>(threads);
  for (uint64_t record = 0; record < records + records / 4; ++record) {
    trcWriteRec(kEntryType, getEnvVar.id, nullptr, 0, nullptr, 0, 0, 0, 0);
  }
}

// ---- Entry and exit records; one iteration is one of each ----

void entryAndExit(benchmark::State& state) {
  writeShare(state.threads());
  const RecordedBytes recorded(state, state.thread_index() == 0 ? 2 : 0, trc::kSmallBytes);
  int64_t code = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(code);
    trcWriteRec(kEntryType, getEnvVar.id, nullptr, 0, nullptr, 0, 0, 0, 0);
    trcWriteRec(kExitType, getEnvVar.id, nullptr, sizeof code, &code, 0, 0, 0, 0);
  }
}
BENCHMARK(entryAndExit)->Name("record/trcWriteRec")->Iterations(kIterations);
BENCHMARK(entryAndExit)->Name("event/trcWriteRec")->Iterations(kIterations);
BENCHMARK(entryAndExit)->Name("threads/one")->Iterations(kIterationsOfThreads);
BENCHMARK(entryAndExit)->Name("threads/two")->Iterations(kIterationsOfThreads)->Threads(2);
// With TRC_MODE=latest:
BENCHMARK(entryAndExit)->Name("latest_record/trcWriteRec")->Iterations(kIterations);
BENCHMARK(entryAndExit)->Name("latest_event/trcWriteRec")->Iterations(kIterations);
BENCHMARK(entryAndExit)->Name("latest_threads/one")->Iterations(kIterations);
BENCHMARK(entryAndExit)->Name("latest_threads/two")->Iterations(kIterations)->Threads(2);

// As large as an entry or exit record in a trace file.
struct RingRecord {
  uint64_t time;
  uint64_t what;
};
static_assert(sizeof(RingRecord) == trc::kSmallBytes);

void writeToRing(uint64_t what) {
  const RingRecord record{MappedRing::now(), what};
  memcpy(ring.next(sizeof record), &record, sizeof record);
  benchmark::ClobberMemory();
}

void ringEntryAndExit(benchmark::State& state) {
  int64_t code = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(code);
    writeToRing(getEnvVar.id);
    writeToRing(getEnvVar.id + static_cast<uint64_t>(code));
  }
}
BENCHMARK(ringEntryAndExit)->Name("record/ring")->Iterations(kIterations);
BENCHMARK(ringEntryAndExit)->Name("latest_record/ring")->Iterations(kIterations);
BENCHMARK(ringEntryAndExit)->Name("threads/ring_one")->Iterations(kIterations);
BENCHMARK(ringEntryAndExit)->Name("threads/ring_two")->Iterations(kIterations)->Threads(2);

// The function of the LTTng events. Skips the benchmark and returns null if it is missing.
template <typename Function>
Function* lttngFunction(benchmark::State& state, const char* name) {
  void* const handle = dlopen(BENCH_LTTNG, RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) {
    unavailable(state, dlerror());
    return nullptr;
  }
  auto* const function = reinterpret_cast<Function*>(dlsym(handle, name));
  if (function == nullptr) state.SkipWithError(dlerror());
  return function;
}

void lttngTracepoints(benchmark::State& state, const char* record_name, const char* records_name) {
  auto* const record = lttngFunction<void(int64_t)>(state, record_name);
  if (record == nullptr) return;
  auto* const records = lttngFunction<bool()>(state, records_name);
  if (records == nullptr) return;
  if (!records()) return unavailable(state, "no LTTng session records the events");
  int64_t code = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(code);
    record(code);
  }
}
void lttngEntryAndExit(benchmark::State& state) {
  lttngTracepoints(state, "record_entry_and_exit", "records_events");
}
BENCHMARK(lttngEntryAndExit)->Name("event/lttng")->Iterations(kIterations);
BENCHMARK(lttngEntryAndExit)->Name("latest_event/lttng")->Iterations(kIterations);

// What the kernel does for the records of a trace that only grows: filling pages with zeros and mapping them. The same
// calls as for a file of such a trace.
void newPages(benchmark::State& state) {
  constexpr size_t kFileBytes = 4 << 20;
  static const char zeros[64 << 10] = {};
  for (auto _ : state) {
    const int file = open("/dev/shm", O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    if (file == -1) return state.SkipWithError("no file");
    for (size_t bytes = 0; bytes < kFileBytes; bytes += sizeof zeros) {
      if (write(file, zeros, sizeof zeros) != sizeof zeros) state.SkipWithError("no space");
    }
    void* const mapping = mmap(nullptr, kFileBytes, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    (void)madvise(mapping, kFileBytes, MADV_POPULATE_READ);
    (void)munmap(mapping, kFileBytes);
    state.PauseTiming();
    (void)close(file);  // a trace keeps its pages
    state.ResumeTiming();
  }
  state.counters["ns_per_record"] = benchmark::Counter(
      static_cast<double>(state.iterations()) * (kFileBytes / trc::kSmallBytes) / 1e9,
      benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(newPages)->Name("record/new_pages");
void lttngBareTracepoints(benchmark::State& state) {
  lttngTracepoints(state, "record_bare_entry_and_exit", "records_bare_events");
}
BENCHMARK(lttngBareTracepoints)->Name("lttng/tracepoints")->Iterations(kIterations);

// The trace library on LTTng, beside the other one.
void lttngLibrary(benchmark::State& state) {
  auto* const is_enabled = lttngFunction<bool(const void*)>(state, "is_enabled");
  if (is_enabled == nullptr) return;
  void* const library = dlopen(BENCH_LTTNG_LIBTRC, RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) return unavailable(state, dlerror());
  auto* const write = reinterpret_cast<decltype(&trcWriteRec)>(dlsym(library, "trcWriteRec"));
  void* const provider = dlopen(BENCH_LTTNG_PROVIDER, RTLD_NOW | RTLD_NOLOAD);
  if (write == nullptr || provider == nullptr) return state.SkipWithError("it is not loaded");
  for (const char* const event :
       {"lttng_ust_tracepoint_osutils___record", "lttng_ust_tracepoint_osutils___return"}) {
    if (!is_enabled(dlsym(provider, event)))
      return unavailable(state, "no LTTng session records the events");
  }
  int64_t code = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(code);
    write(kEntryType, getEnvVar.id, nullptr, 0, nullptr, 0, 0, 0, 0);
    write(kExitType, getEnvVar.id, nullptr, sizeof code, &code, 0, 0, 0, 0);
  }
}
BENCHMARK(lttngLibrary)->Name("lttng/trcWriteRec")->Iterations(kIterations);

// ---- Debug records ----

constexpr const char kFormat[] = "getEnvVar: the value of '%s' is found at position %d.\n";
constexpr const char kArgument[] = "LDAPHOME";
constexpr int kNumber = 12;
constexpr size_t kTextBytes = 60;
constexpr size_t kDebugBytes = trc::kSmallBytes + sizeof(uint32_t) + kTextBytes;
constexpr size_t kBufferBytes = 8192;

void debugMessage(benchmark::State& state) {
  writeShare(1);
  const RecordedBytes recorded(state, 1, kDebugBytes);
  for (auto _ : state) {
    ldtr_formater_local formatter(getEnvVar.id, LDTR_TYPE_DEBUG, nullptr);
    formatter.debug(LDTR_LEVEL_ORDINARY, kFormat, kArgument, kNumber);
  }
}
constexpr int kIterationsOfDebug = (16 << 20) / kDebugBytes;
BENCHMARK(debugMessage)->Name("debug/ldtr")->Iterations(kIterationsOfDebug);
BENCHMARK(debugMessage)->Name("latest_debug/ldtr")->Iterations(kIterationsOfDebug);

void ringDebugMessage(benchmark::State& state) {
  for (auto _ : state) {
    char* const text = static_cast<char*>(calloc(kBufferBytes, 1));
    const size_t length =
        static_cast<size_t>(snprintf(text, kBufferBytes, kFormat, kArgument, kNumber));
    if (length != kTextBytes) return state.SkipWithError("the text is not 60 bytes long");
    const RingRecord record{MappedRing::now(), getEnvVar.id};
    const uint32_t text_bytes = static_cast<uint32_t>(length);
    unsigned char* const place = ring.next(kDebugBytes);
    memcpy(place, &record, sizeof record);
    memcpy(place + sizeof record, &text_bytes, sizeof text_bytes);
    memcpy(place + sizeof record + sizeof text_bytes, text, length);
    benchmark::ClobberMemory();
    free(text);
  }
}
BENCHMARK(ringDebugMessage)->Name("debug/ring")->Iterations(kIterations);
BENCHMARK(ringDebugMessage)->Name("latest_debug/ring")->Iterations(kIterations);

// ---- Bytes of a record, from the packet headers of the trace file ----

constexpr int kCountedRecords = 100;

void bytesOfEntryAndExit(benchmark::State& state) {
  for (auto _ : state) {
    const size_t before = recordedTraceBytes(0);
    for (int record = 0; record < kCountedRecords; ++record) {
      trcWriteRec(kEntryType, getEnvVar.id, nullptr, 0, nullptr, 0, 0, 0, 0);
    }
    const size_t between = recordedTraceBytes(0);
    const int64_t code = 0;
    for (int record = 0; record < kCountedRecords; ++record) {
      trcWriteRec(kExitType, getEnvVar.id, nullptr, sizeof code, &code, 0, 0, 0, 0);
    }
    const size_t after = recordedTraceBytes(0);
    state.counters["entry"] = static_cast<double>(between - before) / kCountedRecords;
    state.counters["exit"] = static_cast<double>(after - between) / kCountedRecords;
    if (state.counters["entry"] != trc::kSmallBytes || state.counters["exit"] != trc::kSmallBytes) {
      state.SkipWithError("the ring does not write as many bytes as the trace");
    }
  }
}
BENCHMARK(bytesOfEntryAndExit)->Name("bytes/entry_and_exit")->Iterations(1);

void bytesOfDebug(benchmark::State& state) {
  for (auto _ : state) {
    const size_t before = recordedTraceBytes(0);
    for (int record = 0; record < kCountedRecords; ++record) {
      ldtr_formater_local formatter(getEnvVar.id, LDTR_TYPE_DEBUG, nullptr);
      formatter.debug(LDTR_LEVEL_ORDINARY, kFormat, kArgument, kNumber);
    }
    state.counters["without_text"] =
        static_cast<double>(recordedTraceBytes(0) - before) / kCountedRecords - kTextBytes;
  }
}
BENCHMARK(bytesOfDebug)->Name("bytes/debug")->Iterations(1);

}  // namespace
