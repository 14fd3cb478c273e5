// Writes trace records into files that are mapped into the traced program.
//
// Each thread fills files of its own, one after the other. A file is one packet (the first one begins
// with a second, empty packet): its space is reserved before it is mapped, because a store into a hole on
// a full disk would end the program, and it gets its name when its header is valid, because a reader
// refuses a whole trace for one bad packet. A record counts from the moment when the header says that it
// is there. So what a killed program leaves is valid at every instant, up to its last record. Nothing ever
// becomes shorter.
//
// A thread that cannot get its next file stops tracing and counts what it does not record, in its last
// packet if it has one. When the trace itself cannot be made, no thread is traced. Either lasts until
// trcInit() has found that files can be made. The program is never disturbed.
//
// In a trace that keeps the latest records, files are used again: recorder.h.
#include <errno.h>
#include <linux/futex.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <iterator>
#include <new>
#include <optional>
#include <utility>

#include "clock.h"
#include "errno_saver.h"
#include "format.h"
#include "platform.h"
#include "recorder.h"
#include "settings.h"
#include "trace_directory.h"
#include "trace_numbers.h"

uint64_t trcEvents = 0;

namespace {

using namespace trc;

constexpr uint64_t kPageBytes = 4096;
// Sizes of a stream's files, one after the other: long-lived threads need few files.
constexpr uint64_t kFileBytes[] = {kFirstFileBytes, 64 << 10, 256 << 10, 1 << 20, 4 << 20};

// State that a forked child does not inherit: the kernel clears its page in the child (MADV_WIPEONFORK).
struct Process {
  std::atomic<uint64_t>
      generation;         // changes when all threads must begin new streams; 0: no trace yet
  std::atomic<int> lock;  // of ProcessLock
  std::atomic<uint64_t> attempt;  // changes when threads that have stopped may try again
  std::atomic<uint64_t> reserved_bytes;
  std::atomic<uint64_t> streams;
  // Under the lock:
  uint64_t recorder_bytes;  // of the present trace, if it keeps the latest records
  bool has_directory;
  bool keeps_latest;
  TraceDirectory directory;
};
static_assert(sizeof(Process) <= kPageBytes);

Process* process = nullptr;
// Not in that page: a child's generation must differ from that of the streams that it inherits.
std::atomic<uint64_t> last_generation{0};
// Old settings are never freed, because a thread may be reading them.
struct SettingsNode {
  Settings value;
  const SettingsNode* previous;
};
std::atomic<const SettingsNode*> settings{nullptr};
pthread_key_t stream_key;

// Whether the thread is writing a record. A signal handler, or a system call that the program has replaced, may ask
// for another record meanwhile.
enum Activity : int { kIdle, kWriting, kSwitchingFile };

// The file that a thread is writing.
struct Stream {
  char* next;  // where the next record goes; null like the next three: no file
  char* end;
  Packet* packet;  // holds the records
  char* file;
  uint64_t file_bytes;
  uint64_t generation;
  uint64_t attempt;
  uint64_t instance;
  uint64_t discarded;  // records requested during another one, or after the stream stopped
  uint64_t published;  // of these, those that the packet has
  Clock clock;
  // In a trace that keeps the latest records:
  recorder::StreamId recorder;
  uint64_t excess_bytes;    // by which records in the file are larger than the smallest
  unsigned int files;       // in this generation
  unsigned int size_index;  // of the next file in kFileBytes
  unsigned int tid;
  bool stopped;  // until the generation or the attempt changes
  std::atomic<int> activity;
};
constinit __attribute__((tls_model("initial-exec"))) thread_local Stream stream{};

class ProcessLock {
 public:
  // A mutex of the C library cannot be in a page that a child finds cleared.
  ProcessLock() {
    int state = kFree;
    if (process->lock.compare_exchange_strong(state, kTaken, std::memory_order_acquire)) return;
    while (process->lock.exchange(kTakenWithWaiters, std::memory_order_acquire) != kFree) {
      (void)syscall(SYS_futex, &process->lock, FUTEX_WAIT_PRIVATE, kTakenWithWaiters, nullptr);
    }
  }
  ~ProcessLock() {
    if (process->lock.exchange(kFree, std::memory_order_release) == kTakenWithWaiters) {
      (void)syscall(SYS_futex, &process->lock, FUTEX_WAKE_PRIVATE, 1);
    }
  }
  ProcessLock(const ProcessLock&) = delete;
  ProcessLock& operator=(const ProcessLock&) = delete;

 private:
  enum State : int { kFree, kTaken, kTakenWithWaiters };
};

// Blocks signals and cancellation, so that neither a handler with longjmp() nor a cancellation leaves a change of
// files half done, and saves errno.
class SignalBlocker {
 public:
  SignalBlocker() {
    sigset_t all;
    (void)sigfillset(&all);
    (void)pthread_sigmask(SIG_SETMASK, &all, &signals_);
    (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &cancellation_);
  }
  ~SignalBlocker() {
    (void)pthread_setcancelstate(cancellation_, nullptr);
    (void)pthread_sigmask(SIG_SETMASK, &signals_, nullptr);
  }
  SignalBlocker(const SignalBlocker&) = delete;
  SignalBlocker& operator=(const SignalBlocker&) = delete;

 private:
  osutils::ErrnoSaver saved_errno_;
  sigset_t signals_;
  int cancellation_;
};

void unmapFile(Stream& s) {
  char* const file = s.file;
  s.file = nullptr;
  s.packet = nullptr;
  s.next = s.end = nullptr;
  // Last, because a program's own munmap() may trace.
  if (file != nullptr) (void)munmap(file, s.file_bytes);
}

// Reserves up to `wanted` bytes of the process's limit for a file. Returns their number, or 0 if fewer than `needed`
// are left.
uint64_t reserve(uint64_t needed, uint64_t wanted, uint64_t bound) {
  uint64_t reserved = process->reserved_bytes.load(std::memory_order_relaxed);
  uint64_t granted;
  do {
    const uint64_t left = bound - std::min(bound, reserved);
    granted = std::min(wanted, left / kPageBytes * kPageBytes);
    if (granted < needed) return 0;
  } while (!process->reserved_bytes.compare_exchange_weak(reserved, reserved + granted,
                                                          std::memory_order_relaxed));
  return granted;
}

// Begins a trace in `directory`. Null means that none could be made: threads do not try again until the next
// generation.
void beginTrace(const TraceDirectory* directory, bool keeps_latest) {
  recorder::forgetStreams();
  process->reserved_bytes.fetch_add(process->recorder_bytes, std::memory_order_relaxed);
  process->recorder_bytes = 0;
  process->keeps_latest = keeps_latest;
  process->has_directory = directory != nullptr;
  if (directory != nullptr) process->directory = *directory;
  process->generation.store(last_generation.fetch_add(1, std::memory_order_relaxed) + 1,
                            std::memory_order_release);
}

// What a thread needs to open a file of the trace.
struct Trace {
  int directory;  // open; -1 when it is unavailable
  Uuid uuid;
  uint64_t generation;
  uint64_t attempt;
  uint64_t max_bytes;
  bool keeps_latest;
};

// Begins a trace if there is none. The caller holds the process lock.
Trace joinTrace() {
  // Read under the lock, so that no trace begins with settings that trcInit() has just replaced.
  const Settings& current = settings.load(std::memory_order_acquire)->value;
  if (process->generation.load(std::memory_order_relaxed) == 0) {
    TraceDirectory made;
    const bool is_made = makeTraceDirectory(current.directory, current.keeps_latest, made);
    beginTrace(is_made ? &made : nullptr, current.keeps_latest);
  }
  Trace trace{.directory = -1,
              .uuid = {},
              .generation = process->generation.load(std::memory_order_relaxed),
              .attempt = process->attempt.load(std::memory_order_relaxed),
              .max_bytes = current.max_bytes,
              .keeps_latest = process->keeps_latest};
  if (process->has_directory) {
    trace.uuid = process->directory.uuid;
    trace.directory = openTraceDirectory(current.directory, process->directory);
  }
  return trace;
}

Packet* makePacket(char* at, const Stream& s, const Trace& trace, uint64_t bytes, uint64_t begin,
                   uint64_t discarded) {
  constexpr uint64_t kBits = 8;
  return new (at) Packet{kPacketMagic,  trace.uuid, 0,     s.instance, sizeof(Packet) * kBits,
                         bytes * kBits, begin,      begin, discarded,  s.tid};
}

bool makeFile(Stream& s, const Trace& trace, uint64_t size, uint64_t begin) {
  char hidden[64];  // readers ignore names that begin with a dot
  (void)snprintf(hidden, sizeof hidden, ".stream-%u-%llu-%u", s.tid,
                 static_cast<unsigned long long>(s.instance), s.files);
  char* const file = makeMappedFile(trace.directory, hidden, size);
  if (file == nullptr) return false;
  char* at = file;
  // Readers show by how much the number of discarded records grows from one packet to the next, so the first packet
  // is an empty one. They sort the packets of several files by begin time, so no two may have the same.
  if (s.files == 0) {
    (void)makePacket(at, s, trace, sizeof(Packet), begin - 1, 0);
    at += sizeof(Packet);
  }
  const auto packet_bytes = static_cast<uint64_t>(file + size - at);
  const uint64_t discarded = s.discarded;
  Packet* const packet = makePacket(at, s, trace, packet_bytes, begin, discarded);
  if (renameat(trace.directory, hidden, trace.directory, hidden + 1) == 0) {
    unmapFile(s);
    s.file = file;
    s.file_bytes = size;
    s.packet = packet;
    s.next = at + sizeof(Packet);
    s.end = file + size;
    s.published = discarded;
    ++s.files;
    ++s.size_index;
    return true;
  }
  (void)munmap(file, size);
  (void)unlinkat(trace.directory, hidden, 0);
  return false;
}

// Opens the next file of a stream that does not keep the latest records, if it has one within the bound.
bool openNewFile(Stream& s, const Trace& trace, uint64_t record_bytes, uint64_t time) {
  const uint64_t packets = (s.files == 0 ? 2 : 1) * sizeof(Packet);
  const uint64_t needed = roundUp(packets + record_bytes, kPageBytes);
  const uint64_t usual = kFileBytes[std::min<size_t>(s.size_index, std::size(kFileBytes) - 1)];
  const uint64_t size = reserve(needed, std::max(needed, usual), trace.max_bytes);
  if (size == 0) return false;
  if (makeFile(s, trace, size, time)) return true;
  process->reserved_bytes.fetch_sub(size, std::memory_order_relaxed);
  return false;
}

recorder::Target targetIn(const Trace& trace) {
  const uint64_t reserved = process->reserved_bytes.load(std::memory_order_relaxed);
  return {.directory = trace.directory,
          .uuid = trace.uuid,
          .max_bytes = trace.max_bytes - std::min(trace.max_bytes, reserved),
          .used_bytes = &process->recorder_bytes};
}

// The number of records in the stream's file. A small one has kSmallBytes.
uint64_t recordsInFile(const Stream& s) {
  if (s.packet == nullptr) return 0;
  const char* const first = reinterpret_cast<const char*>(s.packet) + sizeof(NumberedPacket);
  return (static_cast<uint64_t>(s.next - first) - s.excess_bytes) / kSmallBytes;
}

// Opens the next file of a stream that keeps the latest records. The caller holds the process lock.
recorder::Result openRecorderFile(Stream& s, const Trace& trace, uint64_t record_bytes,
                                  uint64_t time) {
  const recorder::Target target = targetIn(trace);
  if (s.recorder == 0) s.recorder = recorder::addStream(s.instance, s.tid, time - 1, target);
  if (s.recorder == 0) return recorder::Result::kNoFile;
  const uint64_t discarded = s.discarded;
  recorder::OpenFile file;
  const recorder::Result result = recorder::openNextFile(
      s.recorder, target, {record_bytes, time, recordsInFile(s), discarded}, file);
  if (result != recorder::Result::kOpened) return result;
  s.file = file.base;
  s.file_bytes = file.bytes;
  s.packet = file.packet;
  s.next = file.records;
  s.end = file.base + file.bytes;
  s.published = discarded;
  s.excess_bytes = 0;
  return result;
}

// Opens the stream's next file, with room for a record of `record_bytes` at `time`. Returns false if the stream
// has stopped or must stop now.
bool openNextFile(Stream& s, uint64_t record_bytes, uint64_t time) {
  if (s.stopped && s.generation == process->generation.load(std::memory_order_relaxed) &&
      s.attempt == process->attempt.load(std::memory_order_relaxed)) {
    return false;
  }

  const SignalBlocker blocker;
  checkClockSource();
  std::optional<ProcessLock> lock(std::in_place);
  const Trace trace = joinTrace();
  if (!trace.keeps_latest) lock.reset();
  if (s.generation != trace.generation) {
    unmapFile(s);
    s.generation = trace.generation;
    s.instance = process->streams.fetch_add(1, std::memory_order_relaxed);
    s.files = 0;
    s.tid = static_cast<unsigned int>(gettid());
    s.discarded = s.published = 0;
    s.recorder = 0;
  }
  // trcInit() has only checked that a first file can be made.
  if (s.stopped || s.files == 0) s.size_index = 0;
  s.attempt = trace.attempt;
  auto result = recorder::Result::kNoFile;
  if (trace.directory != -1) {
    if (trace.keeps_latest) {
      result = openRecorderFile(s, trace, record_bytes, time);
    } else if (openNewFile(s, trace, record_bytes, time)) {
      result = recorder::Result::kOpened;
    }
    (void)close(trace.directory);
  }
  s.stopped = result == recorder::Result::kNoFile;
  if (s.stopped) s.end = s.next;  // no smaller record may follow a missing one
  // endThread() runs only for a thread that has a value of the key.
  if (result == recorder::Result::kOpened) (void)pthread_setspecific(stream_key, &s);
  return result == recorder::Result::kOpened;
}

// Tells the readers how many records are missing. Adds to the number, because another thread may add those that it
// has overwritten.
void publishDiscarded(Stream& s) {
  if (s.packet == nullptr) return;
  const std::atomic_ref<uint64_t> discarded(s.packet->events_discarded);
  discarded.fetch_add(s.discarded - s.published, std::memory_order_release);
  s.published = s.discarded;
}

bool nextFile(Stream& s, uint64_t record_bytes, uint64_t time) {
  const SettingsNode* const node = settings.load(std::memory_order_acquire);
  if (node == nullptr || node->value.isOff()) return false;
  const bool opened = openNextFile(s, record_bytes, time);
  if (!opened) ++s.discarded;
  if (s.packet != nullptr) publish(s.packet->timestamp_end, time);
  publishDiscarded(s);
  return opened;
}

__attribute__((noinline, cold)) bool switchFile(Stream& s, uint64_t bytes, uint64_t time) {
  s.activity.store(kSwitchingFile, std::memory_order_relaxed);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  const bool switched = nextFile(s, bytes, time);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  s.activity.store(kWriting, std::memory_order_relaxed);
  return switched;
}

template <typename Word>
char* put(char* at, Word word) {
  memcpy(at, &word, sizeof word);
  return at + sizeof word;
}

constexpr bool fits(uint64_t value, unsigned bits) { return value >> bits == 0; }
constexpr bool fitsSigned(int64_t value, unsigned bits) {
  return value >> (bits - 1) == 0 || value >> (bits - 1) == -1;
}

// Makes room for a record of `bytes` at `time`. Returns false if the stream has stopped.
bool hasRoom(Stream& s, uint64_t bytes, uint64_t time) {
  if (static_cast<uint64_t>(s.end - s.next) >= bytes &&
      s.generation == process->generation.load(std::memory_order_relaxed)) [[likely]] {
    return true;
  }
  return switchFile(s, bytes, time);
}

// Makes the bytes at s.next a record that readers see. Inlined, because a call would be a large part of the few
// nanoseconds of a small record.
__attribute__((always_inline)) inline void commit(Stream& s, uint64_t bytes, uint64_t time) {
  // If a handler has forked since hasRoom(), the packet is the parent's.
  if (process->generation.load(std::memory_order_relaxed) == 0) [[unlikely]]
    return;
  // In this order, so that every record within the content size is complete and no later than the end time.
  publish(s.packet->timestamp_end, time);
  const auto start = static_cast<uint64_t>(s.next - reinterpret_cast<char*>(s.packet));
  publish(s.packet->content_size, (start + bytes) * 8);
  s.next += roundUp(bytes, kRecordAlignment);
}

// A small record without text. Inlined like commit().
__attribute__((always_inline)) inline void writeSmall(Stream& s, uint64_t layout, uint64_t type,
                                                      uint64_t id, int64_t code) {
  constexpr unsigned kTypeShift = kLayoutBits + kTimeBits;
  constexpr unsigned kFunctionShift = kTypeShift + kTypeBits - 64;
  constexpr unsigned kCodeShift = kFunctionShift + kFunctionBits + kObjectBits;
  const uint64_t first = layout | type << kTypeShift;
  const uint64_t second =
      type >> (64 - kTypeShift) | id << kFunctionShift | static_cast<uint64_t>(code) << kCodeShift;

  const uint64_t time = s.clock.now();
  if (!hasRoom(s, kSmallBytes, time)) return;
  put(put(s.next, first | (time & kTimeMask) << kLayoutBits), second);
  commit(s, kSmallBytes, time);
}

// Any other record.
__attribute__((noinline)) void writeLong(Stream& s, uint64_t layout, uint64_t type, uint64_t id,
                                         const void* obj, uint64_t length, const void* data) {
  const bool is_small =
      layout == kMessage && obj == nullptr && fits(type, kTypeBits) && fits(id, kFunctionBits);
  length = std::min(length, trace::kMaxTextBytes);
  uint64_t bytes = is_small ? kSmallBytes : kWideBytes;
  if (layout == kReturn) bytes += sizeof(int64_t);
  if (layout == kMessage) bytes += sizeof(uint32_t) + length;

  const uint64_t time = s.clock.now();
  if (!hasRoom(s, bytes, time)) return;
  char* at = s.next;
  if (is_small) {
    at = put(at, layout | time << kLayoutBits);
    at = put(at, type | id << kTypeBits);
  } else {
    at = put(at, layout | kWide | time << kLayoutBits);
    at = put(at, type);
    at = put(at, id);
    at = put(at, obj);
  }
  if (layout == kMessage) at = put(at, static_cast<uint32_t>(length));
  if (layout != kRecord) memcpy(at, data, length);
  s.excess_bytes += roundUp(bytes, kRecordAlignment) - kSmallBytes;
  commit(s, bytes, time);
}

__attribute__((always_inline)) inline void write(Stream& s, uint64_t type, uint64_t id,
                                                 const void* obj, uint64_t length,
                                                 const void* data) {
  const bool is_small = obj == nullptr && fits(type, kTypeBits) && fits(id, kFunctionBits);
  uint64_t layout = kRecord;
  int64_t code = 0;
  if (data != nullptr && length != 0) {
    layout = kMessage;
    if (length == sizeof code && trace::isExit(type)) {
      layout = kReturn;
      memcpy(&code, data, sizeof code);
    }
  }
  if (is_small && layout != kMessage && fitsSigned(code, kCodeBits)) [[likely]] {
    writeSmall(s, layout, type, id, code);
  } else {
    writeLong(s, layout, type, id, obj, length, data);
  }
}

// Called during another record of this thread.
__attribute__((noinline, cold)) void discard(Stream& s) {
  ++s.discarded;
  // If a handler has forked, the packet is the parent's.
  if (s.activity.load(std::memory_order_relaxed) == kWriting &&
      s.generation == process->generation.load(std::memory_order_relaxed)) {
    publishDiscarded(s);
  }
}

// Discards this thread's records while it holds the process lock: a replaced system call that traces would wait for
// that lock forever.
class ReentryGuard {
 public:
  ReentryGuard() : previous_(stream.activity.exchange(kWriting, std::memory_order_relaxed)) {}
  ~ReentryGuard() { stream.activity.store(previous_, std::memory_order_relaxed); }
  ReentryGuard(const ReentryGuard&) = delete;
  ReentryGuard& operator=(const ReentryGuard&) = delete;

 private:
  int previous_;
};

// Hands the files of a thread that ends to the trace. Returns false if they are not files of a trace that keeps the
// latest records.
bool endRecorderStream(Stream& s) {
  if (s.recorder == 0) return false;
  const ProcessLock lock;
  const ReentryGuard guard;
  if (s.generation != process->generation.load(std::memory_order_relaxed)) return false;
  const Trace trace = joinTrace();
  s.file = nullptr;
  s.packet = nullptr;
  s.next = s.end = nullptr;
  s.generation = 0;
  recorder::endStream(s.recorder, targetIn(trace));
  (void)close(trace.directory);  // fails if it is -1
  // There may be room now for threads that have stopped.
  process->attempt.fetch_add(1, std::memory_order_relaxed);
  return true;
}

void endThread(void*) {
  const SignalBlocker blocker;  // a signal handler may trace
  if (!endRecorderStream(stream)) unmapFile(stream);
}

// Continues the present trace with these settings, or begins a new one. Returns false if it cannot be written. The
// caller holds the process lock.
bool prepareTrace(const Settings& wanted, bool is_new) {
  uint64_t reserved = process->reserved_bytes.load(std::memory_order_relaxed);
  if (is_new) reserved += process->recorder_bytes;
  if (wanted.max_bytes < kFirstFileBytes || wanted.max_bytes - kFirstFileBytes < reserved)
    return false;

  if (!is_new && process->has_directory) {
    const int directory = openTraceDirectory(wanted.directory, process->directory);
    if (directory != -1) {
      const bool is_writable = canMakeFirstFile(directory);
      (void)close(directory);
      if (is_writable) process->attempt.fetch_add(1, std::memory_order_relaxed);
      return is_writable;
    }
  }
  TraceDirectory made;
  if (!makeTraceDirectory(wanted.directory, wanted.keeps_latest, made)) return false;
  beginTrace(&made, wanted.keeps_latest);
  return true;
}

// Applies the environment's settings; with `now`, begins their trace at once. Returns false and changes nothing if a
// setting is invalid or the trace cannot be written.
bool applySettings(bool now) {
  auto* const fresh = new (std::nothrow) SettingsNode;
  if (fresh == nullptr) return false;
  const Settings& wanted = fresh->value;
  if (!readSettings(fresh->value)) {
    delete fresh;
    return false;
  }

  const SignalBlocker blocker;
  const ProcessLock lock;
  const ReentryGuard guard;
  fresh->previous = settings.load(std::memory_order_relaxed);
  const Settings* const previous = fresh->previous != nullptr ? &fresh->previous->value : nullptr;
  const bool is_new = previous == nullptr || previous->keeps_latest != wanted.keeps_latest ||
                      strcmp(previous->directory, wanted.directory) != 0;
  if (now && !wanted.isOff() && !prepareTrace(wanted, is_new)) {
    delete fresh;
    return false;
  }

  if (wanted.isOff()) process->generation.store(0, std::memory_order_relaxed);
  if (wanted.events) __atomic_store_n(&trcEvents, *wanted.events, __ATOMIC_RELAXED);
  if (is_new || previous->max_bytes != wanted.max_bytes) {
    settings.store(fresh, std::memory_order_release);
  } else {
    delete fresh;
  }
  return true;
}

void resetInChild() { memset(static_cast<void*>(process), 0, sizeof *process); }

__attribute__((constructor)) void initialize() {
  void* const page =
      mmap(nullptr, kPageBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (page == MAP_FAILED) return;
  if (pthread_key_create(&stream_key, endThread) != 0) return;
  process = new (page) Process{};
  // Works for every kind of fork; the handler works only for the C library's fork().
  if (madvise(page, kPageBytes, MADV_WIPEONFORK) != 0 &&
      pthread_atfork(nullptr, nullptr, resetInChild) != 0) {
    process = nullptr;
    return;
  }
  (void)applySettings(false);  // there is no caller to report to
}

}  // namespace

int trcInit() { return process != nullptr && applySettings(true) ? 0 : -1; }

void trcWriteRec(uint64_t type, uint64_t id, const void* obj, uint64_t length, const void* data,
                 uint64_t, uint64_t, uint64_t, uint64_t) {
  Stream& s = stream;
  if (s.activity.load(std::memory_order_relaxed) != kIdle) [[unlikely]]
    return discard(s);
  s.activity.store(kWriting, std::memory_order_relaxed);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  write(s, type, id, obj, length, data);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  s.activity.store(kIdle, std::memory_order_relaxed);
}
