// client LIBTRC MODE: a program that loads the trace library and looks at what it does to the process. The test
// compares what it prints.
#include <dlfcn.h>
#include <errno.h>
#include <malloc.h>
#include <pthread.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

namespace {

constexpr uint64_t kEntry = 0x3200000;
constexpr uint64_t kExit = 0x3210000;
constexpr uint64_t kDebug = 0x3400000;
constexpr uint64_t kDoesFileExist = 0x3E060100;

void (*write_record)(uint64_t, uint64_t, const void*, uint64_t, const void*, uint64_t, uint64_t,
                     uint64_t, uint64_t);
int (*initialize)();
uint64_t* events;

void record(uint64_t type, uint64_t id, const void* object = nullptr) {
  write_record(type, id, object, 0, nullptr, 0, 0, 0, 0);
}

void message(const std::string& text, uint64_t id = kDoesFileExist) {
  write_record(kDebug, id, nullptr, text.size(), text.data(), 0, 0, 0, 0);
}

void exitRecord(int64_t code) {
  write_record(kExit, kDoesFileExist, nullptr, sizeof code, &code, 0, 0, 0, 0);
}

bool isLttngLoaded() {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    if (line.find("/liblttng-ust") != std::string::npos) return true;
  }
  return false;
}

// The threads other than the first one, and how many of them take signals such as SIGTERM.
void countThreads(int& threads, int& open_to_signals) {
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    if (task.path().filename() == std::to_string(getpid())) continue;
    ++threads;
    std::ifstream status(task.path() / "status");
    for (std::string line; std::getline(status, line);) {
      constexpr unsigned long long kTerminate = 1ULL << 14;
      if (line.starts_with("SigBlk:") &&
          (std::stoull(line.substr(7), nullptr, 16) & kTerminate) == 0)
        ++open_to_signals;
    }
  }
}

void printState() {
  int threads = 0;
  int open_to_signals = 0;
  countThreads(threads, open_to_signals);
  printf("events %llx, LTTng %s, %d more threads, %d of them take signals\n",
         static_cast<unsigned long long>(*events), isLttngLoaded() ? "loaded" : "not loaded",
         threads, open_to_signals);
}

void recordOneOfEach() {
  record(kEntry, kDoesFileExist);
  record(kEntry, kDoesFileExist, reinterpret_cast<const void*>(0xAB0));
  exitRecord(-5);
  exitRecord(INT64_MIN);
  message("a text");
  message(std::string("before\0after", 12));
  message(std::string(70'000, 'm'));
  message("8 bytes!");  // as many as a code has
  write_record(kExit, kDoesFileExist, nullptr, 9, "no number", 0, 0, 0, 0);
  record(0x123456789AB, 0xCDEF01234567);
}

// A request for cancellation must stay pending while records are written.
void* recordWhileCancelled(void* done) {
  (void)pthread_cancel(pthread_self());
  for (int n = 0; n < 20'000; ++n) exitRecord(n);
  *static_cast<bool*>(done) = true;
  pthread_testcancel();
  return nullptr;
}

void recordInChild() {
  record(kEntry, kDoesFileExist);
  fflush(stdout);
  const pid_t child = fork();
  if (child == 0) {
    record(kEntry, kDoesFileExist);
    const int result = initialize();
    exitRecord(1);
    printf("child %d, trcInit %d\n", getpid(), result);
    fflush(stdout);
    _exit(0);
  }
  (void)waitpid(child, nullptr, 0);
  exitRecord(0);
  printf("parent %d\n", getpid());
}

// Forks while other threads record.
int forkOften() {
  for (int thread = 0; thread < 3; ++thread) {
    std::thread([] {
      for (;; (void)usleep(20)) record(kEntry, kDoesFileExist);
    }).detach();
  }
  int ended = 0;
  for (int n = 0; n < 30; ++n) {
    const pid_t child = fork();
    if (child == 0) {
      exitRecord(n);
      exit(7);
    }
    int status = 0;
    if (waitpid(child, &status, 0) == child && WIFEXITED(status) && WEXITSTATUS(status) == 7)
      ++ended;
  }
  printf("%d children ended\n", ended);
  fflush(stdout);
  _exit(0);
}

}  // namespace

int main(int, char** argv) {
  errno = ERANGE;
  void* const library = dlopen(argv[1], RTLD_NOW);
  const bool keeps_errno = errno == ERANGE;
  if (library == nullptr) {
    puts(dlerror());
    return 1;
  }
  write_record = reinterpret_cast<decltype(write_record)>(dlsym(library, "trcWriteRec"));
  initialize = reinterpret_cast<decltype(initialize)>(dlsym(library, "trcInit"));
  events = static_cast<uint64_t*>(dlsym(library, "trcEvents"));
  if (write_record == nullptr || initialize == nullptr || events == nullptr) return 1;

  const std::string mode = argv[2];
  if (mode == "state") {
    printState();
  } else if (mode == "init") {  // a program that selects events itself
    if (argv[3] != nullptr) *events = strtoull(argv[3], nullptr, 16);
    printf("trcInit %d, ", initialize());
    printState();
  } else if (mode == "init-with") {  // after a change of the environment
    setenv("TRC_EVENTS", argv[3], 1);
    printf("trcInit %d, ", initialize());
    printState();
  } else if (mode == "kinds") {
    recordOneOfEach();
  } else if (mode == "levels") {  // messages that are no function's
    for (const uint64_t id : {0xC8010001, 0xC8110011}) message("a text", id);
  } else if (mode == "start") {
    const size_t used = mallinfo2().uordblks;
    for (int n = 0; n < 1000; ++n) (void)initialize();
    printf("errno %s, memory %s\n", keeps_errno ? "kept" : "changed",
           mallinfo2().uordblks < used + 10'000 ? "kept" : "lost");
  } else if (mode == "errno") {
    errno = ERANGE;
    recordOneOfEach();
    puts(errno == ERANGE ? "kept" : "changed");
  } else if (mode == "fork") {
    recordInChild();
  } else if (mode == "forks") {
    return forkOften();
  } else if (mode == "cancel") {
    bool done = false;
    void* result = nullptr;
    pthread_t thread;
    if (pthread_create(&thread, nullptr, recordWhileCancelled, &done) != 0) return 1;
    (void)pthread_join(thread, &result);
    printf("%s, %s\n", done ? "done" : "interrupted",
           result == PTHREAD_CANCELED ? "then cancelled" : "not cancelled");
  } else if (mode == "lines") {  // each line of a file is a number of records
    (void)signal(SIGUSR1, [](int) {});
    printf("%d\n", getpid());
    fflush(stdout);
    std::ifstream lines(argv[3]);
    for (std::string line; std::getline(lines, line);) {
      const int records = std::stoi(line);
      errno = ERANGE;
      for (int n = 0; n < records; ++n) record(kEntry, kDoesFileExist);
      puts(errno == ERANGE ? "written" : strerror(errno));
      fflush(stdout);
    }
  } else {
    return 2;
  }
  return 0;
}
