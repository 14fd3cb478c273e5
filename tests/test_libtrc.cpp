// libtrc through its built shared object. What it wrote is read with babeltrace2, as its users do.
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdarg.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <map>
#include <new>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "ldtr.h"
#include "platform.h"
#include "world.h"

// What the library calls. Each does what the C library's does, until a test asks for more.
namespace {
std::atomic<int> files_opened;
std::atomic<int> descriptors_in_place_of_a_stream;  // seen in a call that opens or writes a file
std::chrono::nanoseconds realtime_before_monotonic{0};
std::atomic<bool> openat_traces;
std::atomic<int> to_become_standard_output{-1};  // amid the next openat()

bool is_standard_stream_open() {
  for (int stream = 0; stream <= STDERR_FILENO; ++stream) {
    if (fcntl(stream, F_GETFD) != -1) return true;
  }
  return false;
}
}  // namespace

extern "C" {
__attribute__((visibility("default"))) int openat(int directory, const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  if (openat_traces) trcWriteRec(0x3400000, 0x3E060100, nullptr, 6, "openat", 0, 0, 0, 0);
  if (const int output = to_become_standard_output.exchange(-1); output >= 0) {
    (void)dup2(output, STDOUT_FILENO);
  }
  const int descriptor =
      static_cast<int>(syscall(SYS_openat, directory, path, flags | O_LARGEFILE, mode));
  ++files_opened;
  if (descriptor >= 0 && descriptor <= STDERR_FILENO) ++descriptors_in_place_of_a_stream;
  return descriptor;
}

__attribute__((visibility("default"))) ssize_t write(int descriptor, const void* data,
                                                     size_t bytes) {
  if (is_standard_stream_open()) ++descriptors_in_place_of_a_stream;
  return syscall(SYS_write, descriptor, data, bytes);
}

__attribute__((visibility("default"))) int clock_gettime(clockid_t clock, timespec* time) noexcept {
  static const auto real =
      reinterpret_cast<int (*)(clockid_t, timespec*)>(dlsym(RTLD_NEXT, "clock_gettime"));
  if (clock != CLOCK_REALTIME || realtime_before_monotonic.count() == 0) return real(clock, time);
  const int result = real(CLOCK_MONOTONIC, time);
  const int64_t now =
      time->tv_sec * 1'000'000'000 + time->tv_nsec - realtime_before_monotonic.count();
  time->tv_sec = now / 1'000'000'000;
  time->tv_nsec = now % 1'000'000'000;
  return result;
}
}

namespace {

namespace fs = std::filesystem;
using testing::Contains;
using testing::Each;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;

constexpr uint64_t kEntry = 0x3200000;
constexpr uint64_t kExit = 0x3210000;
constexpr uint64_t kDebug = 0x3400000;
constexpr uint64_t kDoesFileExist = 0x3E060100;

struct Event {
  int pid;
  unsigned long tid;
  std::string type;  // name and number as babeltrace2 shows them
  std::string function;
  std::string object;
  std::string code;  // "" when there is none
  std::string text;
};

struct Reading {
  int exit_status = -1;
  std::vector<Event> events;
  std::string errors;
};

// What comes after `label`, up to `end`.
std::string field(const std::string& line, const char* label, const char* end) {
  const size_t at = line.find(label);
  if (at == std::string::npos) return "";
  const size_t from = at + strlen(label);
  return line.substr(from, line.find(end, from) - from);
}

Event parse(const std::string& line) {
  Event event{};
  event.pid = atoi(field(line, ":(", ")").c_str());
  event.tid = strtoul(field(line, "{ tid = ", " ").c_str(), nullptr, 10);
  event.type = field(line, "type = ( ", " )");
  event.function = field(line, "function = ( ", " )");
  event.object = field(line, "object = ", line.find(", code = ") != std::string::npos ? "," : " ");
  if (event.object.ends_with(',')) event.object.pop_back();
  event.code = field(line, ", code = ", " }");
  const size_t text = line.find("text = \"");
  if (text != std::string::npos) event.text = line.substr(text + 8, line.rfind("\" }") - text - 8);
  return event;
}

// Reads the trace or traces below a directory. A reader that is missing is an error like any other.
Reading read(const std::string& directory) {
  const TempDir temp;
  const std::string command =
      "babeltrace2 '" + directory + "' 2>'" + temp.path("errors") + "' </dev/null";
  Reading reading;
  FILE* const output = popen(command.c_str(), "r");
  if (output == nullptr) return reading;
  char* line = nullptr;
  size_t size = 0;
  while (getline(&line, &size, output) > 0) reading.events.push_back(parse(line));
  free(line);
  const int status = pclose(output);
  reading.exit_status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  reading.errors = contentsOf(temp.path("errors"));
  return reading;
}

// Reads a trace that must be in order.
std::vector<Event> readEvents(const std::string& directory) {
  Reading reading = read(directory);
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_EQ(reading.errors, "");
  return std::move(reading.events);
}

std::vector<fs::path> entries(const fs::path& directory) {
  std::vector<fs::path> found;
  for (const auto& entry : fs::directory_iterator(directory)) found.push_back(entry.path());
  std::sort(found.begin(), found.end());
  return found;
}

bool isHidden(const fs::path& path) { return path.filename().string().starts_with('.'); }

void record(uint64_t type, uint64_t id, const void* object = nullptr) {
  trcWriteRec(type, id, object, 0, nullptr, 0, 0, 0, 0);
}

// How many records the reader says are missing.
uint64_t discarded(const Reading& reading) {
  constexpr std::string_view kWarning = "Tracer discarded ";
  uint64_t sum = 0;
  for (size_t at = 0; (at = reading.errors.find(kWarning, at)) != std::string::npos;) {
    at += kWarning.size();
    sum += strtoull(reading.errors.c_str() + at, nullptr, 10);
  }
  return sum;
}

void message(std::string_view text, uint64_t id = kDoesFileExist) {
  trcWriteRec(kDebug, id, nullptr, text.size(), text.data(), 0, 0, 0, 0);
}

void exitRecord(long code, const void* object = nullptr, uint64_t id = kDoesFileExist) {
  trcWriteRec(kExit, id, object, sizeof code, &code, 0, 0, 0, 0);
}

// Switches the tracing of this (child) process to a directory.
int traceInto(const std::string& directory, const char* max_bytes = nullptr) {
  setenv("TRC_DIR", directory.c_str(), 1);
  unsetenv("TRC_EVENTS");
  if (max_bytes != nullptr) {
    setenv("TRC_MAX_BYTES", max_bytes, 1);
  } else {
    unsetenv("TRC_MAX_BYTES");
  }
  return trcInit();
}

void traceMuch(int megabytes) {
  const std::string text(1000, 't');
  for (int i = 0; i < megabytes * 1000; ++i) message(text);
}

std::vector<std::string> texts(const std::vector<Event>& events) {
  std::vector<std::string> found;
  for (const Event& event : events) found.push_back(event.text);
  return found;
}

// ---- what a reader sees ----

TEST(TrcRecords, FourThreadsLoseNothingAndKeepTheirOrder) {
  constexpr int kThreads = 4;
  constexpr int kRecords = 10'000;
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              std::vector<std::thread> threads;
              for (int t = 0; t < kThreads; ++t) {
                threads.emplace_back([t] {
                  for (int i = 0; i < kRecords; ++i) {
                    message(std::to_string(t) + " " + std::to_string(i),
                            i % 2 == 0 ? 0x3E060100 : 0x3E040201);
                  }
                });
              }
              for (std::thread& thread : threads) thread.join();
              return 0;
            }),
            0);

  const std::vector<Event> events = readEvents(temp.path("t"));

  ASSERT_THAT(events, SizeIs(kThreads * kRecords));
  std::map<unsigned long, int> next;
  std::map<unsigned long, std::string> names;
  for (const Event& event : events) {
    const int number = next[event.tid]++;
    const size_t blank = event.text.find(' ');
    const std::string thread = event.text.substr(0, blank);
    ASSERT_EQ(names.emplace(event.tid, thread).first->second, thread);
    ASSERT_EQ(event.text.substr(blank + 1), std::to_string(number));
    ASSERT_EQ(event.type, "\"debug\" : container = 0x3400000");
    ASSERT_EQ(event.function, number % 2 == 0 ? "\"doesFileExist\" : container = 0x3E060100"
                                              : "\"putEnvVar\" : container = 0x3E040201");
  }
  EXPECT_THAT(next, SizeIs(kThreads));
}

uint64_t monotonicTime() {
  timespec time;
  (void)clock_gettime(CLOCK_MONOTONIC, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

// Long enough a burst that most of its times do not come from the clock itself.
TEST(TrcRecords, BearTheTimeOfTheMonotonicClock) {
  constexpr size_t kRecords = 60'000;
  constexpr uint64_t kTolerance = 2'000;
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (size_t i = 0; i < kRecords; ++i) {
                if (i % 20'000 == 0) usleep(2'000);  // and the clock is met again after a pause
                record(kEntry, kDoesFileExist, reinterpret_cast<const void*>(monotonicTime()));
              }
              return 0;
            }),
            0);

  const std::string command = "babeltrace2 --clock-cycles --no-delta '" + temp.path("t") + "'";
  FILE* const output = popen(command.c_str(), "r");
  ASSERT_NE(output, nullptr);
  std::vector<uint64_t> times;
  std::vector<uint64_t> befores;
  char* line = nullptr;
  size_t size = 0;
  while (getline(&line, &size, output) > 0) {
    times.push_back(strtoull(field(line, "[", "]").c_str(), nullptr, 10));
    befores.push_back(strtoull(field(line, "object = ", " ").c_str(), nullptr, 16));
  }
  free(line);
  EXPECT_EQ(pclose(output), 0);

  ASSERT_THAT(times, SizeIs(kRecords));
  EXPECT_TRUE(std::is_sorted(times.begin(), times.end()));
  for (size_t i = 0; i < kRecords; ++i) {
    ASSERT_GE(times[i] + kTolerance, befores[i]) << i;
    if (i + 1 < kRecords) {
      ASSERT_LE(times[i], befores[i + 1] + kTolerance) << i;
    }
  }
}

// A machine without a battery-backed clock starts in 1970, and its monotonic clock may be ahead.
TEST(TrcRecords, BearTheTimeAlsoWhereTheMonotonicClockBeganBefore1970) {
  const TempDir temp;
  double before = 0;
  for (const auto behind : {std::chrono::milliseconds(250), std::chrono::milliseconds(750)}) {
    SCOPED_TRACE(behind.count());
    const std::string root = temp.path(std::to_string(behind.count()));
    ASSERT_EQ(inChild([&] {
                realtime_before_monotonic = behind;
                if (traceInto(root) != 0) return 1;
                message("now");
                return 0;
              }),
              0);
    before = static_cast<double>(monotonicTime()) / 1e9 - static_cast<double>(behind.count()) / 1e3;

    const std::string metadata = contentsOf(entries(root).at(0) / "metadata");
    EXPECT_EQ(field(metadata, "offset_s = ", ";"), "-1");
    EXPECT_EQ(field(metadata, "; offset = ", ";").substr(0, 1) == "-", false);
    FILE* const output = popen(("babeltrace2 --clock-seconds '" + root + "'").c_str(), "r");
    ASSERT_NE(output, nullptr);
    double shown = 0;
    EXPECT_EQ(fscanf(output, "[%lf]", &shown), 1);
    pclose(output);
    EXPECT_LE(shown, before);
    EXPECT_GE(shown, before - 60);
  }
}

TEST(TrcRecords, TypesHaveNames) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (const uint64_t type : {0x3200000U, 0x32A0000U, 0x3210000U, 0x32B0000U,
                                          0x30B0000U, 0x30C0000U, 0x3400000U, 0x3070000U}) {
                record(type, kDoesFileExist);
              }
              return 0;
            }),
            0);

  std::vector<std::string> types;
  for (const Event& event : readEvents(temp.path("t"))) types.push_back(event.type);
  EXPECT_THAT(
      types, ElementsAre(
                 "\"entry\" : container = 0x3200000", "\"entry\" : container = 0x32A0000",
                 "\"exit\" : container = 0x3210000", "\"exit\" : container = 0x32B0000",
                 "\"exit_error\" : container = 0x30B0000", "\"exit_error\" : container = 0x30C0000",
                 "\"debug\" : container = 0x3400000", "\"debug_error\" : container = 0x3070000"));
}

TEST(TrcRecords, ANameCoversTheWholeLowByteOfItsId) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (const uint64_t id : {0x3E0600FFU, 0x3E060100U, 0x3E0601FFU, 0xC8010000U,
                                        0xC80100FFU, 0xC8110000U, 0xC8120000U}) {
                record(kDebug, id);
                record(kDebug, id, &temp);  // the object makes it a wide record
              }
              return 0;
            }),
            0);

  std::vector<std::string> functions;
  const std::vector<Event> events = readEvents(temp.path("t"));
  for (size_t i = 0; i < events.size(); i += 2) {
    functions.push_back(events[i].function);
    EXPECT_EQ(events[i + 1].function, events[i].function);
  }
  EXPECT_THAT(
      functions,
      ElementsAre("<unknown> : container = 0x3E0600FF",
                  "\"doesFileExist\" : container = 0x3E060100",
                  "\"doesFileExist\" : container = 0x3E0601FF",
                  "\"ldtr_fun\" : container = 0xC8010000", "\"ldtr_fun\" : container = 0xC80100FF",
                  "\"ldtr_fun\" : container = 0xC8110000", "<unknown> : container = 0xC8120000"));
}

TEST(TrcRecords, UnknownAndLargeNumbersAreKept) {
  const TempDir temp;
  const std::vector<uint64_t> numbers = {0,          1,           0x3FFFFFF, 0x4000000,
                                         0xFFFFFFFF, 0x100000000, UINT64_MAX};
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (const uint64_t number : numbers) {
                record(number, 7);
                record(7, number);
                record(7, 7, reinterpret_cast<void*>(number));
                trcWriteRec(number, number, reinterpret_cast<void*>(number), 4, "text", 0, 0, 0, 0);
              }
              return 0;
            }),
            0);

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(numbers.size() * 4));
  for (size_t i = 0; i < numbers.size(); ++i) {
    char hex[32];
    snprintf(hex, sizeof hex, "0x%lX", static_cast<unsigned long>(numbers[i]));
    const std::string shown = std::string("<unknown> : container = ") + hex;
    SCOPED_TRACE(shown);
    EXPECT_EQ(events[4 * i].type, shown);
    EXPECT_EQ(events[4 * i + 1].function, shown);
    EXPECT_EQ(events[4 * i + 2].object, hex);
    EXPECT_EQ(events[4 * i + 3].type, shown);
    EXPECT_EQ(events[4 * i + 3].function, shown);
    EXPECT_EQ(events[4 * i + 3].object, hex);
    EXPECT_EQ(events[4 * i + 3].text, "text");
  }
}

TEST(TrcRecords, ExitRecordsCarryTheirCode) {
  const TempDir temp;
  const std::vector<long> codes = {0,    1,    -1,        89,        511,      512,
                                   -512, -513, INT32_MIN, INT64_MAX, INT64_MIN};
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (const long code : codes) {
                exitRecord(code);
                exitRecord(code, &temp);
              }
              return 0;
            }),
            0);

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(codes.size() * 2));
  for (size_t i = 0; i < events.size(); ++i) {
    EXPECT_EQ(events[i].code, std::to_string(codes[i / 2]));
    EXPECT_EQ(events[i].object == "0x0", i % 2 == 0);
    EXPECT_EQ(events[i].function, "\"doesFileExist\" : container = 0x3E060100");
  }
}

TEST(TrcRecords, TextsOfAllLengths) {
  constexpr size_t kLongestText = 64 << 10;
  const TempDir temp;
  const std::vector<size_t> lengths = {
      1, 2, 7, 8, 9, 4096, 30000, 65000, kLongestText, kLongestText + 1};
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (const size_t length : lengths) message(std::string(length - 1, 'x') + "!");
              return 0;
            }),
            0);

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(lengths.size()));
  for (size_t i = 0; i + 1 < lengths.size(); ++i) {
    EXPECT_TRUE(events[i].text == std::string(lengths[i] - 1, 'x') + "!") << lengths[i];
  }
  EXPECT_TRUE(events.back().text == std::string(kLongestText, 'x'));
}

TEST(TrcRecords, UnusualTexts) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("");
              trcWriteRec(kDebug, kDoesFileExist, nullptr, 100, nullptr, 0, 0, 0, 0);
              message("Gr\u00fc\u00dfe");
              message(std::string_view("one\0two", 7));
              message("12345678");  // as long as a code, but not that of an exit record
              trcWriteRec(kExit, kDoesFileExist, nullptr, 3, "odd", 0, 0, 0, 0);
              message("last");
              return 0;
            }),
            0);

  EXPECT_THAT(texts(readEvents(temp.path("t"))),
              ElementsAre("", "", "Gr\u00fc\u00dfe", "one", "12345678", "odd", "last"));
  // The reader shows a text up to its first NUL; the file has all of it.
  const fs::path trace = entries(temp.path("t")).at(0);
  std::string files;
  for (const fs::path& path : entries(trace)) files += contentsOf(path);
  EXPECT_THAT(files, HasSubstr(std::string("one\0two", 7)));
}

TEST(TrcRecords, AreSmall) {
  const TempDir temp;
  uint64_t used[3] = {};
  const auto contentBytes = [&] {
    constexpr size_t kPacketBytes = 80;  // the records are in the file's second packet
    const fs::path stream = entries(entries(temp.path("t")).at(0)).at(1);
    uint64_t bits = 0;
    memcpy(&bits, contentsOf(stream).data() + kPacketBytes + 32, sizeof bits);
    return bits / 8;
  };
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              record(kEntry, kDoesFileExist);
              const uint64_t first = contentBytes();
              record(kEntry, kDoesFileExist);
              used[0] = contentBytes() - first;
              exitRecord(INT64_MAX, &temp);
              used[1] = contentBytes() - first - used[0];
              trcWriteRec(kDebug, kDoesFileExist, &temp, 4, "text", 0, 0, 0, 0);
              used[2] = contentBytes() - first - used[0] - used[1];
              EXPECT_LE(used[0], 48U);
              EXPECT_LE(used[1], 48U);
              EXPECT_LE(used[2], 56U + 4U);
              EXPECT_GT(used[0], 0U);
              EXPECT_GT(used[2], 4U);
              return 0;
            }),
            0);
}

TEST(TrcRecords, TwoProcessesMergeInOrderOfTime) {
  const TempDir temp;
  int first_to_second[2];
  int second_to_first[2];
  ASSERT_EQ(pipe(first_to_second), 0);
  ASSERT_EQ(pipe(second_to_first), 0);
  // The two take turns.
  const auto run = [&](const char* name, int from, int to, bool begins) {
    const pid_t pid = fork();
    if (pid != 0) return pid;
    char turn = 0;
    bool good = traceInto(temp.path("t")) == 0;
    for (int i = 0; i < 50 && good; ++i) {
      if (i > 0 || !begins) good = ::read(from, &turn, 1) == 1;
      message(name + std::to_string(i));
      if (i < 49 || begins) good = good && write(to, &turn, 1) == 1;
    }
    _exit(good ? 0 : 1);
  };
  const pid_t first = run("a", second_to_first[0], first_to_second[1], true);
  const pid_t second = run("b", first_to_second[0], second_to_first[1], false);
  for (const pid_t pid : {first, second}) {
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_EQ(status, 0);
  }
  for (const int fd :
       {first_to_second[0], first_to_second[1], second_to_first[0], second_to_first[1]}) {
    close(fd);
  }

  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(100));
  for (int i = 0; i < 100; ++i) {
    const Event& event = events[static_cast<size_t>(i)];
    EXPECT_EQ(event.text, (i % 2 == 0 ? "a" : "b") + std::to_string(i / 2));
    EXPECT_EQ(event.pid, i % 2 == 0 ? first : second);
  }
}

// ---- threads, forks, signals ----

pthread_key_t late_key;

TEST(TrcThreads, ComeAndGo) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              // Runs after the thread's stream was closed in some round of the destructors.
              if (pthread_key_create(&late_key, [](void* rounds) {
                    message("late");
                    if (const auto left = reinterpret_cast<intptr_t>(rounds); left > 1) {
                      pthread_setspecific(late_key, reinterpret_cast<void*>(left - 1));
                    }
                  }) != 0) {
                return 2;
              }
              for (int i = 0; i < 20; ++i) {
                std::thread([] {
                  message("early");
                  pthread_setspecific(late_key, reinterpret_cast<void*>(intptr_t{2}));
                }).join();
              }
              message("main");
              return 0;
            }),
            0);

  const std::vector<std::string> found = texts(readEvents(temp.path("t")));
  EXPECT_EQ(std::count(found.begin(), found.end(), "early"), 20);
  EXPECT_EQ(std::count(found.begin(), found.end(), "late"), 40);
  EXPECT_EQ(std::count(found.begin(), found.end(), "main"), 1);
}

TEST(TrcThreads, ThatAreShortTakeLittleSpace) {
  constexpr int kThreads = 3000;
  constexpr uintmax_t kMostBytes = 15'000'000;
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              for (int i = 0; i < kThreads; ++i) {
                std::thread([] {
                  record(kEntry, kDoesFileExist);
                  exitRecord(0);
                }).join();
              }
              return 0;
            }),
            0);
  uintmax_t bytes = 0;
  int streams = 0;
  for (const fs::path& path : entries(entries(temp.path("t")).at(0))) {
    struct stat status;
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    bytes +=
        std::max<uintmax_t>(fs::file_size(path), static_cast<uintmax_t>(status.st_blocks) * 512);
    streams += path.filename() != "metadata";
  }
  EXPECT_EQ(streams, kThreads);
  EXPECT_LE(bytes, kMostBytes);
}

TEST(TrcFork, TheChildWritesItsOwnTrace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("before");
              const pid_t pid = fork();
              if (pid == 0) {
                for (int i = 0; i < 1000; ++i) message("child");
                std::thread([] { message("child"); }).join();
                _exit(0);
              }
              for (int i = 0; i < 1000; ++i) message("parent");
              int status = 0;
              if (waitpid(pid, &status, 0) != pid || status != 0) return 2;
              message("after");
              return 0;
            }),
            0);

  const std::vector<fs::path> traces = entries(temp.path("t"));
  ASSERT_THAT(traces, SizeIs(2));
  std::vector<Event> parent = readEvents(traces[0]);
  std::vector<Event> child = readEvents(traces[1]);
  if (child.empty() || child[0].text != "child") std::swap(parent, child);
  EXPECT_THAT(child, SizeIs(1001));
  EXPECT_THAT(texts(child), Each("child"));
  ASSERT_THAT(parent, SizeIs(1002));
  EXPECT_EQ(parent.front().text, "before");
  EXPECT_EQ(parent.back().text, "after");
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(2003));
}

TEST(TrcSignals, AHandlerCanTrace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              struct sigaction action = {};
              action.sa_handler = [](int) { message("handler"); };
              sigaction(SIGALRM, &action, nullptr);
              const itimerval often{{0, 200}, {0, 200}};
              setitimer(ITIMER_REAL, &often, nullptr);
              for (int i = 0; i < 50'000; ++i) message(std::to_string(i));
              const itimerval never{};
              setitimer(ITIMER_REAL, &never, nullptr);
              return 0;
            }),
            0);

  const Reading reading = read(temp.path("t"));
  ASSERT_EQ(reading.exit_status, 0) << reading.errors;
  int next = 0;
  for (const Event& event : reading.events) {
    if (event.text == "handler") continue;
    ASSERT_EQ(event.text, std::to_string(next++));
  }
  EXPECT_EQ(next, 50'000);
}

char* guarded_text;
constexpr size_t kGuardedBytes = 4096;

TEST(TrcSignals, ARecordAmidAnotherOneIsCountedAsDiscarded) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first");
              guarded_text = static_cast<char*>(
                  mmap(nullptr, kGuardedBytes, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
              struct sigaction action = {};
              action.sa_handler = [](int) {
                message("nested");
                mprotect(guarded_text, kGuardedBytes, PROT_READ | PROT_WRITE);
                memcpy(guarded_text, "outer", 5);
              };
              sigaction(SIGSEGV, &action, nullptr);
              message(std::string_view(guarded_text, 5));  // its copying raises the signal
              message("last");
              return 0;
            }),
            0);

  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0);
  EXPECT_THAT(texts(reading.events), ElementsAre("first", "outer", "last"));
  EXPECT_THAT(reading.errors, HasSubstr("Tracer discarded 1 event between"));
}

// A process that starts one more in the midst of a record must not count in its parent's trace.
TEST(TrcSignals, ARecordOfAChildThatAHandlerForkedIsNotCountedForItsParent) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first");
              guarded_text = static_cast<char*>(
                  mmap(nullptr, kGuardedBytes, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
              struct sigaction action = {};
              action.sa_handler = [](int) {
                const pid_t pid = fork();
                if (pid == 0) {
                  message("nested");
                  _exit(0);
                }
                waitpid(pid, nullptr, 0);
                mprotect(guarded_text, kGuardedBytes, PROT_READ | PROT_WRITE);
                memcpy(guarded_text, "outer", 5);
              };
              sigaction(SIGSEGV, &action, nullptr);
              message(std::string_view(guarded_text, 5));
              return 0;
            }),
            0);

  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "outer"));
}

// A child that goes on with the record that the handler interrupted must not take back what its parent has
// written since.
TEST(TrcSignals, AChildThatAHandlerForkedDoesNotFinishTheRecordOfItsParent) {
  const TempDir temp;
  static pid_t child;
  static int wait_here[2];
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0 || pipe(wait_here) != 0) return 1;
              message("first");
              guarded_text = static_cast<char*>(
                  mmap(nullptr, kGuardedBytes, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
              struct sigaction action = {};
              action.sa_handler = [](int) {
                mprotect(guarded_text, kGuardedBytes, PROT_READ | PROT_WRITE);
                memcpy(guarded_text, "outer", 5);
                child = fork();
                char byte;
                if (child == 0 && ::read(wait_here[0], &byte, 1) != 1) _exit(2);
              };
              sigaction(SIGSEGV, &action, nullptr);
              message(std::string_view(guarded_text, 5));
              if (child == 0) {
                message("child");
                _exit(0);
              }
              message("later");
              if (::write(wait_here[1], "x", 1) != 1) return 3;
              int status = -1;
              waitpid(child, &status, 0);
              return status;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "outer", "later", "child"));
}

TEST(TrcProgram, KeepsItsErrnoItsDescriptorsAndItsSignalMask) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              const int descriptors = openDescriptors();
              errno = 77;
              traceMuch(1);
              EXPECT_EQ(errno, 77);
              EXPECT_EQ(openDescriptors(), descriptors);
              sigset_t mask;
              pthread_sigmask(SIG_BLOCK, nullptr, &mask);
              EXPECT_EQ(sigismember(&mask, SIGTERM), 0);
              fs::remove_all(temp.path("t"));
              errno = 77;
              traceMuch(1);  // no next file can be made
              EXPECT_EQ(errno, 77);
              EXPECT_EQ(openDescriptors(), descriptors);
              return 0;
            }),
            0);
  EXPECT_FALSE(pathExists(temp.path("t")));
}

// What other threads print to a closed stream must not get into a trace.
TEST(TrcProgram, WithoutStandardStreamsNeverHasAFileInTheirPlace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              const int kept[] = {dup(0), dup(1), dup(2)};
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) close(stream);
              files_opened = 0;
              descriptors_in_place_of_a_stream = 0;
              const int rc = traceInto(temp.path("t"));
              traceMuch(1);
              std::thread([] { message("other"); }).join();
              const int opened = files_opened;
              const int in_place = descriptors_in_place_of_a_stream;
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) dup2(kept[stream], stream);
              EXPECT_EQ(rc, 0);
              EXPECT_GT(opened, 10);
              EXPECT_EQ(in_place, 0);
              return 0;
            }),
            0);
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1001));
}

TEST(TrcProgram, MayOpenAStandardStreamAgainWhileAFileIsMade) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              const int kept = dup(STDOUT_FILENO);
              close(STDOUT_FILENO);
              to_become_standard_output = kept;
              const int rc = traceInto(temp.path("t"));
              const bool is_open = fcntl(STDOUT_FILENO, F_GETFD) != -1;
              dup2(kept, STDOUT_FILENO);
              EXPECT_EQ(rc, 0);
              EXPECT_EQ(to_become_standard_output, -1);
              EXPECT_TRUE(is_open);
              return 0;
            }),
            0);
}

// A record that trcInit() itself leads to must not wait for trcInit() to end.
TEST(TrcProgram, MayTraceItsOwnSystemCalls) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              std::atomic<bool> is_done{false};
              std::thread tracing([&] {  // which has no file yet
                openat_traces = true;
                EXPECT_EQ(trcInit(), 0);
                openat_traces = false;
                message("recorded");
                openat_traces = true;
                EXPECT_EQ(trcInit(), 0);
                openat_traces = false;
                is_done = true;
              });
              for (int waited = 0; !is_done && waited < 60'000; ++waited) usleep(1000);
              if (!is_done) _exit(2);
              tracing.join();
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_THAT(texts(reading.events), ElementsAre("recorded"));
  EXPECT_GT(discarded(reading), 0U) << reading.errors;
}

// A function of its own, that returns: the address sanitizer takes the variables of one that a cancelled thread
// leaves for live ones.
__attribute__((noinline)) void traceFromFirstToLast() {
  message("first");  // makes the trace and the thread's file
  traceMuch(1);
  message("last");
}

void* cancelledWhileItTraces(void*) {
  pthread_cancel(pthread_self());
  traceFromFirstToLast();
  pthread_testcancel();
  return nullptr;
}

TEST(TrcProgram, ACancelledThreadFinishesItsRecords) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              const int descriptors = openDescriptors();
              pthread_t thread;
              if (pthread_create(&thread, nullptr, cancelledWhileItTraces, nullptr) != 0) return 2;
              void* result = nullptr;
              pthread_join(thread, &result);
              EXPECT_EQ(result, PTHREAD_CANCELED);
              EXPECT_EQ(openDescriptors(), descriptors);
              message("main");  // nothing stayed locked
              return 0;
            }),
            0);
  const std::vector<std::string> found = texts(readEvents(temp.path("t")));
  ASSERT_THAT(found, SizeIs(1003));
  EXPECT_EQ(found[1001], "last");
  EXPECT_EQ(found[1002], "main");
}

TEST(TrcProgram, AThreadOfTheSmallestStackCanTrace) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "instrumented frames are larger";
#endif
  const TempDir temp;
  ASSERT_EQ(
      inChild([&] {
        setenv("TRC_DIR", temp.path("t").c_str(), 1);
        pthread_attr_t attributes;
        pthread_attr_init(&attributes);
        if (pthread_attr_setstacksize(&attributes, static_cast<size_t>(PTHREAD_STACK_MIN)) != 0)
          return 1;
        pthread_t thread;
        if (pthread_create(
                &thread, &attributes,
                [](void*) -> void* {
                  volatile char used_by_callers[6 << 10];
                  used_by_callers[0] = 'i';
                  if (trcInit() == 0 && used_by_callers[0] == 'i') message("in a small place");
                  return nullptr;
                },
                nullptr) != 0) {
          return 2;
        }
        pthread_join(thread, nullptr);
        return 0;
      }),
      0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("in a small place"));
}

// ---- killed at any moment ----

constexpr int kKilledThreads = 4;
struct Noted {
  std::atomic<uint64_t> last[kKilledThreads];
};

TEST(TrcKilled, EveryTraceIsReadableUpToItsLastRecord) {
  constexpr int kProcesses = 200;
  const TempDir temp;
  void* const memory =
      mmap(nullptr, sizeof(Noted), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(memory, MAP_FAILED);
  std::minstd_rand random(20);
  int traced = 0;
  int changed_files = 0;

  for (int process = 0; process < kProcesses; ++process) {
    SCOPED_TRACE(process);
    auto* const noted = new (memory) Noted{};
    const std::string root = temp.path("t");
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      if (traceInto(root) != 0) _exit(1);
      std::vector<std::thread> threads;
      for (int t = 0; t < kKilledThreads; ++t) {
        threads.emplace_back([t, noted] {
          const std::string filler(150, '.');
          for (uint64_t number = 1;; ++number) {
            message(std::to_string(t) + " " + std::to_string(number) + filler);
            noted->last[t].store(number, std::memory_order_relaxed);
          }
        });
      }
      for (std::thread& thread : threads) thread.join();
    }
    // Most are killed while they trace, some while they begin to. The number of records is bounded
    // rather than the time, because reading them takes much longer than writing them.
    if (process % 8 == 0) {
      usleep(static_cast<useconds_t>(random() % 2000));
    } else {
      const uint64_t enough = random() % 800;
      while (noted->last[0].load(std::memory_order_relaxed) <= enough) usleep(10);
    }
    ASSERT_EQ(kill(pid, SIGKILL), 0);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFSIGNALED(status)) << "it ended by itself: " << status;

    std::map<std::string, uint64_t> last;
    std::vector<fs::path> traces;
    if (fs::exists(root)) traces = entries(root);
    ASSERT_LE(traces.size(), 1U);
    for (const fs::path& trace : traces) {
      if (isHidden(trace)) continue;
      const Reading reading = read(trace);
      ASSERT_EQ(reading.exit_status, 0) << reading.errors;
      ASSERT_EQ(reading.errors, "");
      for (const Event& event : reading.events) {
        const std::string thread = event.text.substr(0, 1);
        ASSERT_EQ(event.text.substr(0, event.text.find('.')),
                  thread + " " + std::to_string(++last[thread]));
      }
      traced += last.empty() ? 0 : 1;
      changed_files += entries(trace).size() > kKilledThreads + 1 ? 1 : 0;
    }
    for (int t = 0; t < kKilledThreads; ++t) {
      EXPECT_GE(last[std::to_string(t)], noted->last[t].load()) << "thread " << t;
    }
    fs::remove_all(root);
  }
  EXPECT_GE(traced, kProcesses / 2);
  EXPECT_GE(changed_files, kProcesses / 4);
  munmap(memory, sizeof(Noted));
}

// ---- what must not harm the program ----

TEST(TrcLimits, AFullFileSystemEndsTheTrace) {
  REQUIRE_ROOT("to mount a small file system");
  const TempDir temp;
  const std::string small = temp.dir("small");
  EXPECT_EQ(withPrivateMounts([&] {
              if (mount("none", small.c_str(), "tmpfs", 0, "size=1m") != 0) return 1;
              if (traceInto(small + "/t") != 0) return 2;
              message(std::string(1000, 't'));
              std::thread other([] { traceMuch(4); });
              traceMuch(4);
              other.join();
              const Reading full = read(small + "/t");
              EXPECT_EQ(full.exit_status, 0) << full.errors;
              EXPECT_GT(full.events.size(), 300U);
              EXPECT_THAT(texts(full.events), Each(std::string(1000, 't')));
              EXPECT_EQ(full.events.size() + discarded(full), 8001U) << full.errors;
              for (const fs::path& path : entries(entries(small + "/t").at(0))) {
                EXPECT_FALSE(isHidden(path)) << path;
              }
              // Not even the metadata fit any more.
              const int filler = open((small + "/filler").c_str(), O_WRONLY | O_CREAT, 0600);
              while (write(filler, "f", 1) == 1) {
              }
              close(filler);
              const pid_t pid = fork();
              if (pid == 0) {
                message("no room");
                _exit(0);
              }
              int status = 0;
              if (waitpid(pid, &status, 0) != pid) return 3;
              EXPECT_EQ(status, 0);
              EXPECT_THAT(entries(small + "/t"), SizeIs(1));
              // Only trcInit() begins again, when it can.
              EXPECT_NE(trcInit(), 0);
              fs::remove(small + "/filler");
              message("not written either");
              EXPECT_EQ(trcInit(), 0);
              message("written");
              const Reading again = read(small + "/t");
              EXPECT_EQ(again.exit_status, 0) << again.errors;
              EXPECT_EQ(again.events.size() + discarded(again), 8003U) << again.errors;
              EXPECT_THAT(texts(again.events), Contains("written"));
              EXPECT_THAT(texts(again.events), Not(Contains("not written either")));
              EXPECT_THAT(entries(small + "/t"), SizeIs(1));
              return 0;
            }),
            0);
}

TEST(TrcLimits, ADirectoryThatCannotBeWrittenIsReportedByInitOnly) {
  REQUIRE_ROOT("to become another user");
  const TempDir temp;
  const std::string closed = temp.dir("closed");
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EXPECT_NE(traceInto(closed), 0);
                     traceMuch(1);
                     std::thread([] { traceMuch(1); }).join();
                     return 0;
                   }),
            0);
  EXPECT_THAT(entries(closed), IsEmpty());
}

TEST(TrcLimits, ADirectoryThatCannotBeMadeIsReportedByInitOnly) {
  const TempDir temp;
  const std::string file = temp.file("file", "content");
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(file), 0);
              message("nowhere");
              EXPECT_NE(traceInto(file + "/below"), 0);
              message("nowhere");
              EXPECT_NE(traceInto(temp.path("no/such")), 0);
              message("nowhere");
              EXPECT_NE(traceInto("/" + std::string(5000, 'x')), 0);
              message("nowhere");
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), SizeIs(1));
  EXPECT_EQ(contentsOf(file), "content");
}

TEST(TrcLimits, ABoundOfOneByteRecordsNothing) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(temp.path("t"), "1"), 0);
              traceMuch(1);
              std::thread([] { traceMuch(1); }).join();
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

TEST(TrcLimits, TheBoundHoldsForAllFilesOfTheProcess) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_EQ(traceInto(temp.path("t"), "1000000"), 0);
              std::atomic<int> begun{0};
              const auto trace = [&] {
                message(std::string(1000, 't'));
                for (++begun; begun < 2;) usleep(100);  // a thread without a file could not tell
                traceMuch(2);
              };
              std::thread other(trace);
              trace();
              other.join();
              return 0;
            }),
            0);

  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_GT(reading.events.size(), 500U);
  EXPECT_EQ(reading.events.size() + discarded(reading), 4002U) << reading.errors;
  uintmax_t bytes = 0;
  for (const fs::path& path : entries(entries(temp.path("t")).at(0))) {
    if (path.filename() != "metadata") bytes += fs::file_size(path);
  }
  EXPECT_LE(bytes, 1'000'000U);
}

TEST(TrcLimits, ALimitOnFileSizesDoesNotEndTheProgram) {
  const TempDir temp;
  for (const rlim_t limit : {0U, 1000U, 20'000U, 100'000U}) {
    SCOPED_TRACE(limit);
    EXPECT_EQ(inChild([&] {
                if (traceInto(temp.path("t" + std::to_string(limit))) != 0) return 1;
                const rlimit small{limit, limit};
                if (setrlimit(RLIMIT_FSIZE, &small) != 0) return 2;
                traceMuch(1);
                return 0;
              }),
              0);
  }
  const Reading reading = read(temp.path("t100000"));
  EXPECT_GT(reading.events.size(), 50U);
  EXPECT_EQ(reading.events.size() + discarded(reading), 1000U) << reading.errors;
}

// ---- what trcInit() begins again ----

void limitDescriptors(rlim_t most) {
  rlimit limit;
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  limit.rlim_cur = most;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
}

TEST(TrcAgain, AFolderThatIsMadeLater) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(temp.path("later/t")), 0);
              message("no folder");
              fs::create_directory(temp.path("later"));
              message("not asked to try again");
              EXPECT_EQ(trcInit(), 0);
              message("recorded");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("later/t"))), ElementsAre("recorded"));
}

// Run by the next test in a process of its own, with the switches set before it is loaded.
TEST(TrcAgain, DISABLED_MakesTheFolderLater) {
  const std::string root = getenv("TRC_DIR");
  message("no folder");
  fs::create_directory(fs::path(root).parent_path());
  message("not asked to try again");
  EXPECT_EQ(trcInit(), 0);
  message("recorded");
}

TEST(TrcAgain, AFolderThatWasMissingAtLoad) {
  const TempDir temp;
  const std::string command = "TRC_DIR='" + temp.path("later/t") + "' TRC_EVENTS=debug " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_also_run_disabled_tests "
                              "--gtest_filter=TrcAgain.DISABLED_MakesTheFolderLater >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  EXPECT_THAT(texts(readEvents(temp.path("later/t"))), ElementsAre("recorded"));
}

TEST(TrcAgain, AThreadThatFoundNoDescriptor) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first");
              std::thread([] {
                rlimit usual;
                getrlimit(RLIMIT_NOFILE, &usual);
                limitDescriptors(3);
                message("lost");
                EXPECT_NE(trcInit(), 0);
                limitDescriptors(usual.rlim_cur);
                message("lost as well");
                EXPECT_EQ(trcInit(), 0);
                message("second");
              }).join();
              message("third");
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_THAT(texts(reading.events), ElementsAre("first", "second", "third"));
  EXPECT_EQ(discarded(reading), 2U) << reading.errors;
  EXPECT_THAT(entries(temp.path("t")), SizeIs(1));
}

TEST(TrcAgain, ATraceThatWasRemoved) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first");
              fs::remove_all(temp.path("t"));
              EXPECT_EQ(trcInit(), 0);
              message("second");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("second"));
}

TEST(TrcAgain, ABoundThatIsRaised) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t"), "100000") != 0) return 1;
              traceMuch(1);
              EXPECT_NE(trcInit(), 0);
              EXPECT_EQ(traceInto(temp.path("t"), "1000000"), 0);
              message("last");
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
  EXPECT_EQ(reading.events.back().text, "last");
  EXPECT_THAT(entries(temp.path("t")), SizeIs(1));
}

TEST(TrcAgain, AFailureLeavesTheTraceAndTheMaskAsTheyWere) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              trcEvents = 0x1000;
              message("first");
              EXPECT_NE(traceInto(temp.path("no/such")), 0);
              setenv("TRC_EVENTS", "all", 1);
              EXPECT_NE(trcInit(), 0);
              EXPECT_EQ(trcEvents, 0x1000U);
              message("second");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
}

TEST(TrcAgain, WithoutADirectoryTheTraceEndsUntilThereIsOne) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first");
              unsetenv("TRC_DIR");
              EXPECT_EQ(trcInit(), 0);
              message("off");
              EXPECT_EQ(traceInto(temp.path("t")), 0);
              message("second");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
  EXPECT_THAT(entries(temp.path("t")), SizeIs(2));
}

// ---- switches ----

// Checks what trcInit answers, and the mask afterwards, in a process with these settings.
void expectSwitched(const char* events, const char* max_bytes, bool accepted, uint64_t mask) {
  SCOPED_TRACE(std::string(events == nullptr ? "unset" : events) + " " +
               (max_bytes == nullptr ? "unset" : max_bytes));
  EXPECT_EQ(inChild([&] {
              unsetenv("TRC_DIR");
              unsetenv("TRC_EVENTS");
              unsetenv("TRC_MAX_BYTES");
              if (events != nullptr) setenv("TRC_EVENTS", events, 1);
              if (max_bytes != nullptr) setenv("TRC_MAX_BYTES", max_bytes, 1);
              trcEvents = 0x5000;
              EXPECT_EQ(trcInit() == 0, accepted);
              EXPECT_EQ(trcEvents, mask);
              return 0;
            }),
            0);
}

TEST(TrcSwitches, NamesAndNumbersSelectEvents) {
  expectSwitched("entry", nullptr, true, 0x1000);
  expectSwitched("exit_error", nullptr, true, 0x2000);
  expectSwitched("entry43", nullptr, true, 0x10000);
  expectSwitched("exit_error43", nullptr, true, 0x20000);
  expectSwitched("debug", nullptr, true, 0x4000000);
  expectSwitched("all", nullptr, true, 0x4033000);
  expectSwitched("entry,debug", nullptr, true, 0x4001000);
  expectSwitched("12288", nullptr, true, 0x3000);
  expectSwitched("0x3000", nullptr, true, 0x3000);
  expectSwitched("0xFFFFFFFFFFFFFFFF", nullptr, true, UINT64_MAX);
  expectSwitched("0", nullptr, true, 0);
  expectSwitched("0x1,entry43", nullptr, true, 0x10001);
}

TEST(TrcSwitches, WithoutAValueTheMaskStays) {
  expectSwitched(nullptr, nullptr, true, 0x5000);
  expectSwitched("", nullptr, true, 0x5000);
}

TEST(TrcSwitches, ABadWordIsRefusedAndChangesNothing) {
  for (const char* const bad : {"entri", "entry,", ",entry", "entry,,debug", "entry debug", "-1",
                                "+1", "0x", "12x", " entry", "18446744073709551616", "ENTRY"}) {
    expectSwitched(bad, nullptr, false, 0x5000);
  }
  for (const char* const bad : {"many", "-1", "1K", "18446744073709551616"}) {
    expectSwitched("entry", bad, false, 0x5000);
  }
}

TEST(TrcSwitches, BitsWithoutADirectoryRecordNothing) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (chdir(temp.path().c_str()) != 0) return 1;
              unsetenv("TRC_DIR");
              setenv("TRC_EVENTS", "all", 1);
              EXPECT_EQ(trcInit(), 0);
              traceMuch(1);
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

TEST(TrcSwitches, ADirectoryAloneCreatesNothingAtLoad) {
  const TempDir temp;
  // The loading of a program that never calls the library: this one, only listing its tests.
  const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=all " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_list_tests >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

// Run by the next test in a process of its own, with the switches set before it is loaded.
TEST(TrcSwitches, DISABLED_RecordsTheMask) {
  record(kEntry, kDoesFileExist, reinterpret_cast<void*>(trcEvents));
}

TEST(TrcSwitches, AreReadAtLoad) {
  const TempDir temp;
  const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=entry,debug " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_also_run_disabled_tests "
                              "--gtest_filter=TrcSwitches.DISABLED_RecordsTheMask >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(1));
  EXPECT_EQ(events[0].object, "0x4001000");
}

TEST(TrcSwitches, ARelativeDirectoryStaysWhereItWas) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (chdir(temp.path().c_str()) != 0) return 1;
              if (traceInto("t") != 0) return 2;
              if (chdir("/") != 0) return 3;
              message("found");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("found"));
}

TEST(TrcSwitches, ANewDirectoryBeginsANewTrace) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("a")) != 0) return 1;
              message("one");
              if (traceInto(temp.path("b")) != 0) return 2;
              message("two");
              if (traceInto(temp.path("b")) != 0) return 3;  // no change
              message("three");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("a"))), ElementsAre("one"));
  EXPECT_THAT(texts(readEvents(temp.path("b"))), ElementsAre("two", "three"));
  EXPECT_THAT(entries(temp.path("b")), SizeIs(1));
}

// ---- security ----

TEST(TrcSecurity, OnlyTheOwnerCanReadATrace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              umask(0);
              if (traceInto(temp.path("t")) != 0) return 1;
              traceMuch(1);
              return 0;
            }),
            0);
  EXPECT_EQ(modeOf(temp.path("t")), 0700U);
  ASSERT_THAT(entries(temp.path("t")), SizeIs(1));
  const fs::path trace = entries(temp.path("t"))[0];
  EXPECT_EQ(modeOf(trace), 0700U);
  ASSERT_GE(entries(trace).size(), 3U);
  for (const fs::path& file : entries(trace)) EXPECT_EQ(modeOf(file), 0600U) << file;
}

TEST(TrcSecurity, ALinkInTheWayOfAFileIsNotFollowed) {
  const TempDir temp;
  const std::string victim = temp.file("victim", "untouched");
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first file");
              const fs::path trace = entries(temp.path("t")).at(0);
              const fs::path file = entries(trace).at(1);
              std::string next = file.filename().string();
              next.back() = '1';
              fs::create_symlink(victim, trace / ("." + next));
              traceMuch(1);
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(victim), "untouched");
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.events.front().text, "first file");
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
}

TEST(TrcSecurity, AnotherDirectoryInThePlaceOfTheTraceIsNotUsed) {
  const TempDir temp;
  const std::string elsewhere = temp.dir("elsewhere");
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("first file");
              const fs::path trace = entries(temp.path("t")).at(0);
              fs::rename(trace, temp.path("moved"));
              fs::create_directory_symlink(elsewhere, trace);
              traceMuch(1);
              fs::remove(trace);
              fs::create_directory(trace);
              std::thread([] { message("a new thread"); }).join();
              EXPECT_THAT(entries(trace), IsEmpty());
              return 0;
            }),
            0);
  EXPECT_THAT(entries(elsewhere), IsEmpty());
  const Reading reading = read(temp.path("moved"));
  EXPECT_EQ(reading.events.front().text, "first file");
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
}

TEST(TrcSecurity, AProgramWithMoreRightsThanItsUserIgnoresTheSwitches) {
  REQUIRE_ROOT("to make a program that runs with another group");
  const TempDir temp;
  const auto run = [&](mode_t mode) {
    const std::string program = temp.path("program");
    fs::copy_file(SECURE_PROGRAM, program, fs::copy_options::overwrite_existing);
    EXPECT_EQ(chown(program.c_str(), 0, kNobody), 0);
    EXPECT_EQ(chmod(program.c_str(), mode), 0);
    const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=all '" + program +
                                "' '" LIBRARY_DIRECTORY "/libtrc.so'";
    const int status = system(command.c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  };

  const int privileged = run(02755);
  if (privileged == 2) GTEST_SKIP() << "the temporary directory's mount ignores set-group-ID";
  EXPECT_EQ(privileged, 0);
  EXPECT_FALSE(pathExists(temp.path("t")));

  EXPECT_EQ(run(0755), 2);
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1));
}

}  // namespace
