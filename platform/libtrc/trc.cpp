// Writes trace records into files that are mapped into the traced program.
//
// Each thread fills files of its own, one after the other. A file is one packet: its space is reserved
// before it is mapped, because a store into a hole on a full disk would end the program, and it gets its
// name when its header is valid, because a reader refuses a whole trace for one bad packet. A record
// counts from the moment when the header says that it is there. So what a killed program leaves is valid
// at every instant, up to its last record. Nothing ever becomes shorter.
//
// Whatever cannot be done ends the tracing of the thread, without a word, and never disturbs the program.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <iterator>
#include <new>

#include "clock.h"
#include "format.h"
#include "platform.h"
#include "settings.h"
#include "trace_directory.h"

#define TRC_API __attribute__((visibility("default")))

extern "C" {
extern TRC_API uint64_t trcEvents;
TRC_API int trcInit(void);
TRC_API void trcWriteRec(uint64_t type, uint64_t id, const void* obj, uint64_t length,
                         const void* data, uint64_t, uint64_t, uint64_t, uint64_t);

uint64_t trcEvents = 0;
}

namespace {

using namespace trc;

constexpr uint64_t kPageBytes = 4096;
// Short-lived threads shall not cost much disk, long-lived ones not many files.
constexpr uint64_t kFileBytes[] = {64 << 10, 256 << 10, 1 << 20, 4 << 20};
// Readers take time in proportion to the square of a text's length.
constexpr uint64_t kLongestText = 64 << 10;

// The state that a forked child must not inherit: the page that holds it is zero in the child.
struct Process {
  std::atomic<uint64_t>
      generation;  // changes when all threads must begin new streams; 0: no trace yet
  std::atomic<bool> locked;
  std::atomic<uint64_t> reserved_bytes;
  std::atomic<uint64_t> streams;
  // Under the lock:
  bool has_directory;
  TraceDirectory directory;
};
static_assert(sizeof(Process) <= kPageBytes);

Process* process = nullptr;
// Outside of that page, so that a child's generation is one that no stream of its parent has.
std::atomic<uint64_t> last_generation{0};
// Former settings stay in memory, linked to the newer ones: a thread may just be reading them.
struct InUse {
  Settings value;
  const InUse* former;
};
std::atomic<const InUse*> settings{nullptr};
pthread_key_t stream_key;

// What a thread is doing about a record: a signal handler, or a system call that the program replaced, may
// ask for another one in the midst of it.
enum Activity : int { kIdle, kWriting, kChangingFile };

// The file that a thread is writing.
struct Stream {
  char* next;  // where the next record goes; null like the next two: no file
  char* end;
  Packet* packet;  // at the beginning of the file
  uint64_t generation;
  uint64_t instance;
  uint64_t discarded;  // records asked for in the midst of another one
  Clock clock;
  unsigned int files;  // in this generation
  unsigned int tid;
  bool stopped;  // until the generation changes
  std::atomic<int> activity;
};
constinit __attribute__((tls_model("initial-exec"))) thread_local Stream stream{};

class ProcessLock {
 public:
  // Its holder has its signals blocked and does a few system calls, once or twice in a process's life:
  // a short sleep serves better here than a mutex, which could not be in the page a child finds zero.
  ProcessLock() {
    while (process->locked.exchange(true, std::memory_order_acquire)) {
      constexpr timespec kPause{0, 100'000};
      (void)nanosleep(&kPause, nullptr);
    }
  }
  ~ProcessLock() { process->locked.store(false, std::memory_order_release); }
  ProcessLock(const ProcessLock&) = delete;
  ProcessLock& operator=(const ProcessLock&) = delete;
};

// While a thread changes files it must not be interrupted by a handler that leaves with a jump, be
// cancelled in one of the system calls, or see its errno changed.
class Undisturbed {
 public:
  Undisturbed() : errno_(errno) {
    sigset_t all;
    (void)sigfillset(&all);
    (void)pthread_sigmask(SIG_SETMASK, &all, &signals_);
    (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &cancellation_);
  }
  ~Undisturbed() {
    (void)pthread_setcancelstate(cancellation_, nullptr);
    (void)pthread_sigmask(SIG_SETMASK, &signals_, nullptr);
    errno = errno_;
  }
  Undisturbed(const Undisturbed&) = delete;
  Undisturbed& operator=(const Undisturbed&) = delete;

 private:
  int errno_;
  sigset_t signals_;
  int cancellation_;
};

template <typename Number>
void publish(Number& where, Number value) {
  std::atomic_ref<Number>(where).store(value, std::memory_order_release);
}

constexpr uint64_t roundUp(uint64_t value, uint64_t unit) {
  return (value + unit - 1) / unit * unit;
}

void leaveFile(Stream& s) {
  if (s.packet != nullptr) {
    (void)munmap(s.packet, static_cast<size_t>(s.end - reinterpret_cast<char*>(s.packet)));
  }
  s.packet = nullptr;
  s.next = s.end = nullptr;
}

// The bytes, at most `wanted`, that the bound of the process leaves for a file of at least `needed`; else 0.
uint64_t reserve(uint64_t needed, uint64_t wanted, uint64_t bound) {
  uint64_t reserved = process->reserved_bytes.load(std::memory_order_relaxed);
  uint64_t granted;
  do {
    const uint64_t left = bound > reserved ? bound - reserved : 0;
    granted = std::min(wanted, left / kPageBytes * kPageBytes);
    if (granted < needed) return 0;
  } while (!process->reserved_bytes.compare_exchange_weak(reserved, reserved + granted,
                                                          std::memory_order_relaxed));
  return granted;
}

// Opens the directory of this process's trace; makes it first when there is none. Fills in its UUID, its
// generation and the bound for its files. Answers -1 when there is no such directory to be had.
int joinTrace(uint8_t (&uuid)[16], uint64_t& generation, uint64_t& max_bytes) {
  const ProcessLock lock;
  // Read under the lock: a trace is never begun with settings that trcInit() has just replaced.
  const Settings& current = settings.load(std::memory_order_acquire)->value;
  const char* const root = current.directory;
  max_bytes = current.max_bytes;
  generation = process->generation.load(std::memory_order_relaxed);
  if (generation == 0) {
    process->has_directory = makeTraceDirectory(root, process->directory);
    generation = last_generation.fetch_add(1, std::memory_order_relaxed) + 1;
    process->generation.store(generation, std::memory_order_release);
  }
  if (!process->has_directory) return -1;
  memcpy(uuid, process->directory.uuid, sizeof uuid);
  return openTraceDirectory(root, process->directory);
}

// Fills the new file with zeros. That reserves its space on file systems that write in place, and the pages, which then
// are in memory already, are mapped in less time than those of a file that only had its space allocated.
bool fill(int fd, uint64_t size) {
  static char zeros[64 * 1024];
  for (uint64_t filled = 0; filled < size;) {
    const ssize_t written = ::write(fd, zeros, std::min<uint64_t>(sizeof zeros, size - filled));
    if (written <= 0) return false;
    filled += static_cast<uint64_t>(written);
  }
  return true;
}

// Maps `size` bytes of the new file with all their memory at hand, or answers null.
char* mapReserved(int fd, uint64_t size) {
  if (!isFileSizeAllowed(size) || !fill(fd, size)) return nullptr;
  void* const base = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (base == MAP_FAILED) return nullptr;
  // Much cheaper than one page fault for each page. Older kernels do not know it.
  if (madvise(base, size, MADV_POPULATE_WRITE) != 0 && errno != EINVAL) {
    (void)munmap(base, size);
    return nullptr;
  }
  return static_cast<char*>(base);
}

bool makeFile(Stream& s, int directory, const uint8_t (&uuid)[16], uint64_t size, uint64_t begin) {
  char hidden[64];  // readers pass over names that begin with a dot
  (void)snprintf(hidden, sizeof hidden, ".stream-%u-%llu-%u", s.tid,
                 static_cast<unsigned long long>(s.instance), s.files);
  const int fd =
      openat(directory, hidden, O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) return false;
  char* const base = mapReserved(fd, size);
  (void)close(fd);
  if (base != nullptr) {
    constexpr uint64_t kBits = 8;
    Packet* const packet =
        new (base) Packet{kPacketMagic, {},    0,     s.instance,  sizeof(Packet) * kBits,
                          size * kBits, begin, begin, s.discarded, s.tid};
    memcpy(packet->trace_uuid, uuid, sizeof uuid);
    if (renameat(directory, hidden, directory, hidden + 1) == 0) {
      s.packet = packet;
      s.next = base + sizeof(Packet);
      s.end = base + size;
      ++s.files;
      return true;
    }
    (void)munmap(base, size);
  }
  (void)unlinkat(directory, hidden, 0);
  return false;
}

// Gives the stream a file with room for a record of this many bytes, which bears this time. False when
// there is none to be had.
bool nextFile(Stream& s, uint64_t record_bytes, uint64_t time) {
  const InUse* const in_use = settings.load(std::memory_order_acquire);
  if (in_use == nullptr || in_use->value.directory[0] == '\0') return false;
  if (s.stopped && s.generation == process->generation.load(std::memory_order_relaxed))
    return false;

  const Undisturbed undisturbed;
  leaveFile(s);
  const uint64_t needed = roundUp(sizeof(Packet) + record_bytes, kPageBytes);
  const uint64_t usual = kFileBytes[std::min<size_t>(s.files, std::size(kFileBytes) - 1)];

  examineCounter();
  uint8_t uuid[16] = {};
  uint64_t generation = 0;
  uint64_t max_bytes = 0;
  const int directory = joinTrace(uuid, generation, max_bytes);
  if (s.generation != generation) {
    s.generation = generation;
    s.instance = process->streams.fetch_add(1, std::memory_order_relaxed);
    s.files = 0;
    s.tid = static_cast<unsigned int>(gettid());
    s.discarded = 0;
  }
  s.stopped = true;
  if (directory >= 0) {
    const uint64_t size = reserve(needed, std::max(needed, usual), max_bytes);
    s.stopped = size == 0 || !makeFile(s, directory, uuid, size, time);
    if (s.stopped) process->reserved_bytes.fetch_sub(size, std::memory_order_relaxed);
    (void)close(directory);
  }
  // The thread's end must find the mapping.
  if (!s.stopped) (void)pthread_setspecific(stream_key, &s);
  return !s.stopped;
}

__attribute__((noinline, cold)) bool changeFile(Stream& s, uint64_t bytes, uint64_t time) {
  s.activity.store(kChangingFile, std::memory_order_relaxed);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  const bool changed = nextFile(s, bytes, time);
  std::atomic_signal_fence(std::memory_order_seq_cst);
  s.activity.store(kWriting, std::memory_order_relaxed);
  return changed;
}

template <typename Word>
char* put(char* at, Word word) {
  memcpy(at, &word, sizeof word);
  return at + sizeof word;
}

bool isExit(uint64_t type) {
  return type == 0x3210000 || type == 0x32B0000 || type == 0x30B0000 || type == 0x30C0000;
}

constexpr bool fits(uint64_t value, unsigned bits) { return value >> bits == 0; }
constexpr bool fitsSigned(int64_t value, unsigned bits) {
  return value >> (bits - 1) == 0 || value >> (bits - 1) == -1;
}

// Makes sure that a record of this many bytes can be written, which bears this time.
bool hasRoom(Stream& s, uint64_t bytes, uint64_t time) {
  if (static_cast<uint64_t>(s.end - s.next) >= bytes &&
      s.generation == process->generation.load(std::memory_order_relaxed)) [[likely]] {
    return true;
  }
  return changeFile(s, bytes, time);
}

// Makes the bytes at s.next a record of the file.
void commit(Stream& s, uint64_t bytes, uint64_t time) {
  // In this order: what the content size covers is complete, and not later than the end time.
  publish(s.packet->timestamp_end, time);
  const auto start = static_cast<uint64_t>(s.next - reinterpret_cast<char*>(s.packet));
  publish(s.packet->content_size, (start + bytes) * 8);
  s.next += roundUp(bytes, kRecordAlignment);
}

// A small record without text. Inlined for the sake of the few nanoseconds that it takes itself.
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
  length = std::min(length, kLongestText);
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
    if (length == sizeof code && isExit(type)) {
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

// Called amid another record of this thread. The reader is told how many records are missing.
__attribute__((noinline, cold)) void discard(Stream& s) {
  ++s.discarded;
  if (s.activity.load(std::memory_order_relaxed) == kWriting && s.packet != nullptr) {
    publish(s.packet->events_discarded, s.discarded);
  }
}

void endThread(void*) {
  const Undisturbed
      undisturbed;  // a signal handler may trace, and must not find the file half left
  leaveFile(stream);
}

// Takes over the environment's settings. Answers false when they cannot be understood.
bool applySettings() {
  auto* const fresh = new (std::nothrow) InUse;
  if (fresh == nullptr) return false;
  if (!readSettings(fresh->value)) {
    delete fresh;
    return false;
  }
  if (fresh->value.events) __atomic_store_n(&trcEvents, *fresh->value.events, __ATOMIC_RELAXED);

  const Undisturbed undisturbed;
  const ProcessLock lock;
  fresh->former = settings.load(std::memory_order_relaxed);
  if (fresh->former != nullptr &&
      strcmp(fresh->former->value.directory, fresh->value.directory) == 0 &&
      fresh->former->value.max_bytes == fresh->value.max_bytes) {
    delete fresh;
    return true;
  }
  settings.store(fresh, std::memory_order_release);
  process->generation.store(0, std::memory_order_relaxed);
  return true;
}

void forgetParent() { memset(static_cast<void*>(process), 0, sizeof *process); }

__attribute__((constructor)) void start() {
  void* const page =
      mmap(nullptr, kPageBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (page == MAP_FAILED) return;
  if (pthread_key_create(&stream_key, endThread) != 0) return;
  process = new (page) Process{};
  // Works for every kind of fork; the handler only for the C library's. One of them is enough.
  if (madvise(page, kPageBytes, MADV_WIPEONFORK) != 0 &&
      pthread_atfork(nullptr, nullptr, forgetParent) != 0) {
    process = nullptr;
    return;
  }
  (void)applySettings();  // nobody is there to be told
}

}  // namespace

int trcInit() {
  if (process == nullptr || !applySettings()) return -1;
  const char* const root = settings.load(std::memory_order_acquire)->value.directory;
  return root[0] == '\0' || makeRoot(root) ? 0 : -1;
}

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
