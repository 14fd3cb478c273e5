// Makes the library's next call of a function fail. This test program defines these functions
// itself; calls that do not come from libosutils.so, or that no fault is set for, go to the real
// one. The call is known by its return address, so the library under test is built without tail
// calls.
#pragma once

#include <limits.h>
#include <netdb.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <functional>
#include <initializer_list>
#include <optional>
#include <set>
#include <string>
#include <vector>

enum class Call {
  // system calls and the C library; fread is fread_unlocked too, fwrite is fputs too
  stat64,
  lstat64,
  fstat64,
  open64,
  close,
  fopen64,
  fclose,
  fread,
  fwrite,
  fflush,
  remove,
  umask,
  fchown,
  fchmod,
  chown,
  lchown,
  chmod,
  ftruncate64,
  lockf64,
  fseeko64,
  ftello64,
  copy_file_range,
  sendfile64,
  fsync,
  syncfs,
  read,
  write,
  mkdir,
  rmdir,
  symlink,
  unlink,
  statfs,
  getcwd,
  gettimeofday,
  system,
  popen,
  fgets,
  getc,
  kill,
  localtime_r,  // gmtime_r and mktime too
  dlopen,
  dlsym,
  dlclose,
  // calls that only the tool, the platform libraries and the C++ library make; those of related
  // functions, for instance openat or pwrite, count as open64, write and so on
  message,  // fwrite, fputs and fprintf to standard error
  access,
  fcntl,
  getrlimit,
  isatty,
  bind,
  setsockopt,
  setenv,
  newlocale,
  realpath,
  opendir,
  readdir,
  mmap,
  rename,
  madvise,
  getrandom,
  pthread_key_create,
  vasprintf,
  // the network
  socket,
  ioctl,
  gethostname,
  gethostbyname,
  getaddrinfo,
  getnameinfo,
  gethostbyname_r,
  gethostbyaddr_r,
  // accounts
  getpwnam,
  getpwuid,
  getgrnam,
  getgrgid,
  getpwuid_r,
  getgrgid_r,
  setpwent,
  endpwent,
  // memory: malloc, calloc, realloc and strdup one by one, `allocation` is any of them
  malloc,
  calloc,
  realloc,
  strdup,
  allocation,
  // threads
  pthread_mutex_lock,
  pthread_mutex_trylock,
  nanosleep,
  pthread_mutex_unlock,
  // platform functions
  vra_asprintf,
  vra_vsnprintf,
  vra_snprintf,
  vra_strlcpy,
  ldap_getenv,
  ldap_putenv,
  trcInit,
  PrintMessageCmdLine,
  // prints of the C library
  vsprintf,
  vsnprintf,
  any,  // of all these
};

// Calls that count together.
class CallSet {
 public:
  constexpr CallSet(Call call) : CallSet({call}) {}
  constexpr CallSet(std::initializer_list<Call> calls) {
    for (const Call call : calls) add(call);
  }
  constexpr CallSet& operator|=(const CallSet& other) {
    bits_[0] |= other.bits_[0];
    bits_[1] |= other.bits_[1];
    return *this;
  }
  constexpr bool has(Call call) const { return (bits_[word(call)] & bit(call)) != 0; }

 private:
  static constexpr int word(Call call) { return static_cast<int>(call) / 64; }
  static constexpr uint64_t bit(Call call) { return uint64_t{1} << (static_cast<int>(call) % 64); }
  constexpr void add(Call call) {
    if (call == Call::any) {
      bits_[0] = bits_[1] = ~uint64_t{0};
    } else if (call == Call::allocation) {
      for (const Call each : {Call::malloc, Call::calloc, Call::realloc, Call::strdup}) add(each);
    } else {
      bits_[word(call)] |= bit(call);
    }
  }

  uint64_t bits_[2] = {};
};
static_assert(static_cast<int>(Call::any) < 128);

// From construction until the end of the scope (or disarm()), the library's `nth` call of these
// functions on this thread fails with `error` in errno (functions that return an error number return
// it), and then `times` - 1 further ones. What failing means: null for a pointer, -1 for a number,
// the error number for pthread_* and getpw*_r, and, for close and fclose, that the file is closed
// all the same. fread and fwrite return 0 and leave the stream's error flag set; fputs returns EOF.
// A mutex that the thread holds is unlocked all the same. umask, setpwent and endpwent are only
// counted. `ldap_putenv`, trcInit and PrintMessageCmdLine return `error` itself. vra_asprintf
// returns -1 and leaves its output untouched; vra_vsnprintf and vra_snprintf return -1.
// getaddrinfo and getnameinfo return `error` itself if it is negative, otherwise EAI_SYSTEM;
// vra_strlcpy returns `error` itself. gethostbyname_r and gethostbyaddr_r return ERANGE, with `error`
// as the resolver's code. isatty returns 0.
constexpr int kNever = INT_MAX;  // as `nth`, of a fault that only counts
class FailingCall {
 public:
  FailingCall(CallSet calls, int error, int nth = 1, int times = 1);
  ~FailingCall();
  FailingCall(const FailingCall&) = delete;
  FailingCall& operator=(const FailingCall&) = delete;

  bool fired() const;
  // How many of these calls the library has made on this thread since construction.
  int calls() const;
  void disarm();

 private:
  int slot_;
};

// From now on, the functions whose calls fail are kept, also those of child processes that are made
// later.
void keepFailedFunctions();
std::set<std::string> failedFunctions();

// What the library passed to its last call of each of these functions on this thread, also when the
// call was made to fail.
struct Passed {
  std::string host_name;  // gethostbyname
  struct {
    size_t host_size;
    const char* service;
    size_t service_size;
    int flags;
  } name_info;  // getnameinfo
  struct {
    hostent* entry;
    ptrdiff_t offset;  // of the buffer, from the entry
    size_t size;
  } work;             // gethostbyname_r, gethostbyaddr_r
  size_t print_size;  // vra_snprintf
};
extern thread_local Passed passed;

// True when the sanitizer owns malloc, so that allocations cannot be made to fail.
bool sanitizerOwnsMalloc();
#define REQUIRE_OWN_MALLOC() \
  if (sanitizerOwnsMalloc()) GTEST_SKIP() << "the sanitizer owns malloc"

// Runs `during` right before the library's next call of the function on this thread, for example to
// change the world between a query and what is done on its answer.
class BeforeCall {
 public:
  BeforeCall(Call call, std::function<void()> during, int nth = 1);
  ~BeforeCall();
  BeforeCall(const BeforeCall&) = delete;
  BeforeCall& operator=(const BeforeCall&) = delete;

  bool fired() const;

 private:
  int slot_;
};

// nanosleep() only counts and calls `instead`, until the end of the scope (all threads).
class FakeSleep {
 public:
  explicit FakeSleep(std::function<void()> instead = [] {});
  ~FakeSleep();
  FakeSleep(const FakeSleep&) = delete;
  FakeSleep& operator=(const FakeSleep&) = delete;

  int calls() const;
  long long microseconds() const;
};

// Until the end of the scope the library's calls of system() on this thread run nothing: they
// answer `status`. One at a time.
class FakeSystem {
 public:
  explicit FakeSystem(int status = 0);
  ~FakeSystem();
  FakeSystem(const FakeSystem&) = delete;
  FakeSystem& operator=(const FakeSystem&) = delete;

  // What would have been run, in order; nothing for a null command.
  const std::vector<std::optional<std::string>>& commands() const { return commands_; }
  int run(const char* command);

 private:
  int status_;
  std::vector<std::optional<std::string>> commands_;
};

// Until the end of the scope the library's calls of gettimeofday() on this thread answer this time.
// One at a time.
class FakeClock {
 public:
  FakeClock(long seconds, long microseconds);
  ~FakeClock();
  FakeClock(const FakeClock&) = delete;
  FakeClock& operator=(const FakeClock&) = delete;
};

// Until the end of the scope the library's calls of statfs() on this thread answer these numbers.
// One at a time.
class FakeStatfs {
 public:
  FakeStatfs(unsigned long available_blocks, unsigned long free_blocks, long block_size,
             long fragment_size);
  ~FakeStatfs();
  FakeStatfs(const FakeStatfs&) = delete;
  FakeStatfs& operator=(const FakeStatfs&) = delete;
};

// Until the end of the scope the library's calls of vra_asprintf() and vra_snprintf() on this
// thread print as usual, but answer `answer`; vra_asprintf() also leaves what it is told. One at a
// time.
class OddPrint {
 public:
  enum Leaves { kTheString, kNull };
  explicit OddPrint(int answer, Leaves leaves = kTheString);
  ~OddPrint();
  OddPrint(const OddPrint&) = delete;
  OddPrint& operator=(const OddPrint&) = delete;

  int answer() const { return answer_; }
  Leaves leaves() const { return leaves_; }

 private:
  int answer_;
  Leaves leaves_;
};

// The library's next call of fread() on this thread delivers the first `bytes` bytes only, because
// of an error that the stream's flag tells of. One at a time.
class CutRead {
 public:
  explicit CutRead(size_t bytes);
  ~CutRead();
  CutRead(const CutRead&) = delete;
  CutRead& operator=(const CutRead&) = delete;

  bool fired() const;
};

// Until the end of the scope kill() signals nobody, whoever calls it, on all threads: it answers
// `answer`. A signal to 0 or -1 would end more than the test. One at a time.
class FakeKill {
 public:
  explicit FakeKill(int answer = 0);
  ~FakeKill();
  FakeKill(const FakeKill&) = delete;
  FakeKill& operator=(const FakeKill&) = delete;

  struct Signal {
    pid_t process;
    int number;
    bool operator==(const Signal&) const = default;
  };
  const std::vector<Signal>& signals() const { return signals_; }
  int run(Signal signal);

 private:
  int answer_;
  std::vector<Signal> signals_;
};

// One call of the library's to PrintMessageCmdLine().
struct CatalogueMessage {
  int arguments[5];
  std::string text;
};
// Those of this process since the last time that they were taken.
std::vector<CatalogueMessage> takeCatalogueMessages();

// Allocations made by the library on this thread since construction that were not freed since (by
// anybody). Zero and useless where sanitizerOwnsMalloc().
class LiveAllocations {
 public:
  LiveAllocations();
  ~LiveAllocations();
  LiveAllocations(const LiveAllocations&) = delete;
  LiveAllocations& operator=(const LiveAllocations&) = delete;

  int blocks() const;

 private:
  long first_;
};

// What one of the library's calls did to a file.
struct FileStep {
  enum Kind {
    kMade,      // the name is new
    kCut,       // to `offset` bytes
    kWritten,   // `data` at `offset`
    kBuffered,  // the same, through a stream that may keep it until kFlushed
    kFlushed,
    kForced,     // a file or a folder
    kForcedAll,  // the whole file system
    kRemoved,    // the name
  };
  Kind kind;
  std::string path;
  off64_t offset = 0;
  std::string data = {};
};

// Until the end of the scope, what the library's calls on this thread did to files, in order. One
// at a time.
class FileSteps {
 public:
  FileSteps();
  ~FileSteps();
  FileSteps(const FileSteps&) = delete;
  FileSteps& operator=(const FileSteps&) = delete;

  const std::vector<FileStep>& all() const { return steps_; }

 private:
  std::vector<FileStep> steps_;
};
