#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <malloc.h>
#include <poll.h>
#include <signal.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <termios.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <map>
#include <sstream>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform.h"
#include "signal_storm.h"
#include "world.h"

namespace {
bool in_place_of_a_stream;   // whether a file was opened with the descriptor of a standard stream
size_t longest_write;        // to standard error; 0: any length
bool is_signalled;           // SIGPIPE arrives during a write to standard error
bool is_cancellation_point;  // each write to standard error, as the real one
bool writes_nothing;         // each write to standard error returns 0
const timespec* time_now;    // of the real-time clock, unless null
int lost_stream = -1;        // another thread closes this one while a file is opened
int new_stream = -1;         // another thread opens this one while a file is opened
}  // namespace

// The clock that the library reads.
extern "C" __attribute__((visibility("default"))) int clock_gettime(clockid_t clock,
                                                                    timespec* now) noexcept {
  if (time_now == nullptr || clock != CLOCK_REALTIME) {
    return static_cast<int>(syscall(SYS_clock_gettime, clock, now));
  }
  *now = *time_now;
  return 0;
}

// The write that the library calls.
extern "C" __attribute__((visibility("default"))) ssize_t write(int descriptor, const void* data,
                                                                size_t size) {
  if (descriptor == STDERR_FILENO) {
    if (writes_nothing) {
      errno = EINTR;  // of an earlier call
      return 0;
    }
    if (is_cancellation_point) pthread_testcancel();
    if (is_signalled) (void)pthread_kill(pthread_self(), SIGPIPE);
    if (longest_write != 0 && size > longest_write) size = longest_write;
  }
  return syscall(SYS_write, descriptor, data, size);
}

// The openat that the library calls.
extern "C" __attribute__((visibility("default"))) int openat(int directory, const char* path,
                                                             int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  if (lost_stream >= 0) close(lost_stream);
  if (new_stream >= 0) {
    const int file = static_cast<int>(syscall(SYS_openat, AT_FDCWD, "/dev/null", O_RDWR, 0));
    dup2(file, new_stream);
    close(file);
  }
  const int descriptor =
      static_cast<int>(syscall(SYS_openat, directory, path, flags | O_LARGEFILE, mode));
  if (descriptor >= 0 && descriptor <= STDERR_FILENO) in_place_of_a_stream = true;
  return descriptor;
}

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr unsigned int kOrdinary = 0xC8010000;
constexpr unsigned int kError = 0xC8110000;

void setSwitch(const char* name, const char* value) {
  if (value == nullptr) {
    unsetenv(name);
  } else {
    setenv(name, value, 1);
  }
}

// The library reads its switches when it is loaded, so each test sets them and then loads a copy in
// a child process.
struct Loaded {
  decltype(&PrintDebug) printDebug;
  decltype(&PrintDebugVa) printDebugVa;
  decltype(&read_ldap_debug) readLdapDebug;
};
Loaded loaded;

// Returns the handle of the library at `path`.
void* openLibrary(const std::string& path) {
  void* const library = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) throw std::runtime_error(dlerror());
  loaded.printDebug = reinterpret_cast<decltype(&PrintDebug)>(dlsym(library, "PrintDebug"));
  loaded.printDebugVa = reinterpret_cast<decltype(&PrintDebugVa)>(dlsym(library, "PrintDebugVa"));
  loaded.readLdapDebug =
      reinterpret_cast<decltype(&read_ldap_debug)>(dlsym(library, "read_ldap_debug"));
  if (loaded.printDebug == nullptr || loaded.printDebugVa == nullptr ||
      loaded.readLdapDebug == nullptr) {
    throw std::runtime_error("a function is missing");
  }
  return library;
}

std::string copyInto(const TempDir& temp) {
  const std::string copy = temp.path("copy.so");
  std::filesystem::copy_file(LIBRARY_DIRECTORY "/liborxldapdbg.so", copy);
  return copy;
}

void load(const char* selection, const char* file) {
  setSwitch("PRINT_DEBUG", selection);
  setSwitch("PRINT_DEBUG_FILE", file);
  const TempDir temp;  // the copy needs no file name after it is loaded
  (void)openLibrary(copyInto(temp));
}

// Runs `body` with a library that is loaded with these switches, and returns what was written to
// standard error.
std::string standardError(const char* selection, const char* file,
                          const std::function<void()>& body) {
  const TempDir temp;
  const std::string error = temp.file("error", "");
  EXPECT_EQ(inChild([&] {
              const int descriptor = open(error.c_str(), O_WRONLY);
              EXPECT_EQ(dup2(descriptor, STDERR_FILENO), STDERR_FILENO);
              close(descriptor);
              load(selection, file);
              body();
              return 0;
            }),
            0);
  return contentsOf(error);
}

// The descriptor that this process has for an open file.
int descriptorOf(const std::string& path) {
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code ignored;
    if (std::filesystem::read_symlink(entry, ignored) == path) {
      return std::stoi(entry.path().filename());
    }
  }
  ADD_FAILURE() << path << " is not open";
  return -1;
}

struct Line {
  std::string time;
  pid_t process;
  pid_t thread;
  std::string text;
};

// Parses printed lines. Fails the test if one is incomplete.
std::vector<Line> lines(const std::string& printed) {
  std::vector<Line> found;
  if (!printed.empty()) {
    EXPECT_EQ(printed.back(), '\n');
  }
  std::istringstream stream(printed);
  for (std::string line; std::getline(stream, line);) {
    EXPECT_LE(line.size() + 1, 2048U);
    for (const char byte : line) {
      if (byte < ' ' || byte > '~') ADD_FAILURE() << "not printable: " << line;
    }
    char time[28] = "";
    Line parts = {};
    int text = 0;
    if (sscanf(line.c_str(), "%27[-0-9T:.Z] %d %d%n", time, &parts.process, &parts.thread, &text) !=
            3 ||
        line.size() <= static_cast<size_t>(text) || line[static_cast<size_t>(text)] != ' ') {
      ADD_FAILURE() << "not a whole line: " << line;
      continue;
    }
    parts.time = time;
    parts.text = line.substr(static_cast<size_t>(text) + 1);
    found.push_back(parts);
  }
  return found;
}

std::vector<std::string> texts(const std::string& printed) {
  std::vector<std::string> found;
  for (const Line& line : lines(printed)) found.push_back(line.text);
  return found;
}

// The compiler does not check the format, because tests pass a null one and "%m".
void printVa(unsigned int level, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  loaded.printDebugVa(level, format, arguments);
  va_end(arguments);
}

void printBothLevels() {
  loaded.printDebug(kOrdinary, "ordinary %d\n", 1);
  loaded.printDebug(kError, "error %d\n", 2);
  printVa(kOrdinary, "ordinary %d\n", 3);
  printVa(kError, "error %d\n", 4);
}

TEST(Selection, NothingIsPrintedOrMadeWithoutIt) {
  const TempDir temp;
  const std::string file = temp.path("log");
  for (const char* selection :
       {static_cast<const char*>(nullptr), "", "none", "ALL", "all ", "1"}) {
    SCOPED_TRACE(selection == nullptr ? "unset" : selection);
    EXPECT_EQ(standardError(selection, file.c_str(),
                            [] {
                              printBothLevels();
                              EXPECT_EQ(loaded.readLdapDebug(), 0);
                            }),
              "");
    EXPECT_FALSE(pathExists(file));
  }
}

TEST(Selection, AllIsEveryMessage) {
  EXPECT_THAT(
      texts(standardError("all", nullptr,
                          [] {
                            printBothLevels();
                            loaded.printDebug(0, "of a level of its own\n");
                            EXPECT_EQ(loaded.readLdapDebug(), 1);
                          })),
      ElementsAre("ordinary 1", "error 2", "ordinary 3", "error 4", "of a level of its own"));
}

TEST(Selection, ErrorIsTheErrorLevelOnly) {
  EXPECT_THAT(texts(standardError("error", nullptr,
                                  [] {
                                    printBothLevels();
                                    EXPECT_EQ(loaded.readLdapDebug(), 1);
                                  })),
              ElementsAre("error 2", "error 4"));
}

TEST(Selection, IsReadOnce) {
  EXPECT_THAT(texts(standardError("all", nullptr,
                                  [] {
                                    loaded.printDebug(kOrdinary, "one");
                                    unsetenv("PRINT_DEBUG");
                                    loaded.printDebug(kOrdinary, "two");
                                  })),
              ElementsAre("one", "two"));
}

// The environment must not change what a set-user-ID program does.
TEST(Selection, IsReadBySecureGetenvOnly) {
  FILE* const symbols =
      popen("nm -D --undefined-only '" LIBRARY_DIRECTORY "/liborxldapdbg.so'", "r");
  ASSERT_NE(symbols, nullptr);
  std::string all;
  char piece[256];
  while (fgets(piece, sizeof piece, symbols) != nullptr) all += piece;
  ASSERT_EQ(pclose(symbols), 0);
  EXPECT_THAT(all, HasSubstr(" secure_getenv"));
  EXPECT_THAT(all, testing::Not(HasSubstr(" getenv")));
}

TEST(PrintedLine, HoldsTimeProcessThreadAndText) {
  const TempDir temp;
  const std::string numbers = temp.path("numbers");
  const timespec before = [] {
    timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    return now;
  }();
  const std::string printed = standardError("all", nullptr, [&] {
    std::thread([&] {
      loaded.printDebug(kOrdinary, "text %s\n", "here");
      writeFile(numbers, std::to_string(getpid()) + " " + std::to_string(gettid()));
    }).join();
  });

  const std::vector<Line> found = lines(printed);
  ASSERT_EQ(found.size(), 1U);
  EXPECT_EQ(std::to_string(found[0].process) + " " + std::to_string(found[0].thread),
            contentsOf(numbers));
  EXPECT_NE(found[0].process, found[0].thread);
  EXPECT_EQ(found[0].text, "text here");

  tm broken_down = {};
  const char* const rest = strptime(found[0].time.c_str(), "%Y-%m-%dT%H:%M:%S", &broken_down);
  ASSERT_NE(rest, nullptr);
  EXPECT_THAT(rest, testing::MatchesRegex("\\.[0-9][0-9][0-9][0-9][0-9][0-9]Z"));
  timespec after;
  clock_gettime(CLOCK_REALTIME, &after);
  EXPECT_GE(timegm(&broken_down), before.tv_sec);
  EXPECT_LE(timegm(&broken_down), after.tv_sec);
}

TEST(PrintedLine, HasTheTimeInUtcWithLeadingZeros) {
  EXPECT_EQ(lines(standardError("all", nullptr,
                                [] {
                                  setenv("TZ", "EST5", 1);
                                  const timespec early{1044072306, 78'999};  // 2003-02-01 04:05:06
                                  time_now = &early;
                                  loaded.printDebug(kOrdinary, "early");
                                  time_now = nullptr;
                                }))
                .at(0)
                .time,
            "2003-02-01T04:05:06.000078Z");
}

TEST(PrintedLine, EndsWithOneNewlineWhateverTheTextEndsWith) {
  EXPECT_THAT(texts(standardError("all", nullptr,
                                  [] {
                                    loaded.printDebug(kOrdinary, "none");
                                    loaded.printDebug(kOrdinary, "newline and blank\n ");
                                    loaded.printDebug(kOrdinary, "two\n\n");
                                    loaded.printDebug(kOrdinary, "%s", "");
                                    loaded.printDebug(kOrdinary, "\n");
                                  })),
              ElementsAre("none", "newline and blank", "two", "", ""));
}

TEST(PrintedLine, CannotBeForged) {
  EXPECT_THAT(
      texts(standardError(
          "all", nullptr,
          [] { loaded.printDebug(kOrdinary, "%s", "a\nb\tc\x1b[2J\r\x7f\\n\xc3\xbc\x9b\n"); })),
      ElementsAre("a\\nb\\tc\\x1b[2J\\x0d\\x7f\\\\n\\xc3\\xbc\\x9b"));
}

TEST(PrintedLine, ShowsEachByteAsPromised) {
  const std::vector<std::string> found = texts(standardError("all", nullptr, [] {
    for (int byte = 1; byte < 256; ++byte) loaded.printDebug(kOrdinary, "<%c>", byte);
  }));
  ASSERT_EQ(found.size(), 255U);
  for (size_t byte = 1; byte < 256; ++byte) {
    char hexadecimal[8];
    (void)snprintf(hexadecimal, sizeof hexadecimal, "\\x%02zx", byte);
    const std::string shown = byte == '\n'                 ? "\\n"
                              : byte == '\t'               ? "\\t"
                              : byte == '\\'               ? "\\\\"
                              : byte >= ' ' && byte <= '~' ? std::string(1, static_cast<char>(byte))
                                                           : hexadecimal;
    EXPECT_EQ(found[byte - 1], "<" + shown + ">");
  }
}

// A text whose last character, an escape of four, fills the longest line; one character more; and plain
// text, which leaves room for an escape.
TEST(PrintedLine, IsFilledAndNeverLonger) {
  const std::vector<Line> found = lines(standardError("all", nullptr, [] {
    const auto print = [](size_t length, const char* end) {
      loaded.printDebug(kOrdinary, "%s%s", std::string(length, 'a').c_str(), end);
    };
    const std::string numbers = std::to_string(getpid()) + " " + std::to_string(gettid()) + " ";
    const size_t room = 2048 - strlen("2003-02-01T04:05:06.000078Z ") - numbers.size() - 1;
    print(room - 4, "\x01");
    print(room - 3, "\x01");
    print(room - 3, "");
    print(room - 2, "");
  }));
  std::vector<size_t> sizes;
  for (const Line& line : found) {
    const std::string numbers =
        std::to_string(line.process) + " " + std::to_string(line.thread) + " ";
    sizes.push_back(line.time.size() + 1 + numbers.size() + line.text.size() + 1);
  }
  const size_t prefix = sizes.at(2) - strlen("\\x01") - 1;
  EXPECT_THAT(sizes, ElementsAre(2048U, 2045U, prefix + 5, 2045U, 2045U, prefix + 2));
}

TEST(PrintedLine, ALongTextGoesOnInFurtherLinesAndLosesNothing) {
  for (const size_t length : {1022U, 1023U, 1024U, 1025U, 4000U, 4096U, 8191U, 100'000U}) {
    SCOPED_TRACE(length);
    std::string text;
    while (text.size() < length) text += std::to_string(text.size()) + ",";
    text.resize(length, 'x');
    const std::vector<Line> found = lines(
        standardError("all", nullptr, [&] { loaded.printDebug(kOrdinary, "%s\n", text.c_str()); }));
    std::string joined;
    for (const Line& line : found) {
      joined += line.text;
      EXPECT_EQ(line.time, found[0].time);
      EXPECT_EQ(line.thread, found[0].thread);
    }
    EXPECT_EQ(joined, text);
    EXPECT_LE(found.size(), length / 1900 + 1);
  }
}

TEST(PrintedLine, ATextWithoutANewlineKeepsItsLastCharacter) {
  for (const size_t length : {1022U, 1023U, 1024U, 1025U}) {
    const std::string text = std::string(length - 1, 'a') + "z";
    EXPECT_THAT(texts(standardError("all", nullptr,
                                    [&] { loaded.printDebug(kOrdinary, "%s", text.c_str()); })),
                ElementsAre(text));
  }
}

TEST(PrintedLine, IsCutWhereThereIsNoMemoryForTheText) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer's memory cannot be limited";
#endif
  EXPECT_THAT(texts(standardError("all", nullptr,
                                  [] {
                                    const std::string text(150U << 20, 'x');
                                    const rlimit limit = {256U << 20, 256U << 20};
                                    EXPECT_EQ(setrlimit(RLIMIT_AS, &limit), 0);
                                    loaded.printDebug(kOrdinary, "%s", text.c_str());
                                  })),
              ElementsAre(std::string(1023, 'x')));
}

// As no file does; the rest of the line is lost.
TEST(PrintedLine, EndsWhereNothingCanBeWritten) {
  EXPECT_EQ(standardError("all", nullptr,
                          [] {
                            (void)alarm(20);
                            writes_nothing = true;
                            loaded.printDebug(kOrdinary, "text");
                          }),
            "");
}

TEST(Memory, IsFreed) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer counts its memory itself";
#endif
  const auto used = [] { return mallinfo2().uordblks + mallinfo2().hblkhd; };
  const std::string path = "/nonexistent/" + std::string(100'000, 'n');
  (void)standardError(nullptr, nullptr, [&] {
    setenv("PRINT_DEBUG", "all", 1);
    setenv("PRINT_DEBUG_FILE", path.c_str(), 1);
    const TempDir library;
    const std::string copy = copyInto(library);
    const size_t before = used();
    (void)openLibrary(copy);
    EXPECT_LT(used(), before + path.size());
    const size_t loaded_size = used();
    loaded.printDebug(kOrdinary, "%s", path.c_str());
    EXPECT_EQ(used(), loaded_size);
  });
}

TEST(PrintedLine, ALongTextOfEscapesFits) {
  const std::string text(5000, '\x01');
  std::string joined;
  for (const std::string& part : texts(standardError(
           "all", nullptr, [&] { loaded.printDebug(kOrdinary, "%s", text.c_str()); }))) {
    joined += part;
  }
  std::string expected;
  for (size_t i = 0; i < text.size(); ++i) expected += "\\x01";
  EXPECT_EQ(joined, expected);
}

// As to a terminal, when a signal arrives.
TEST(PrintedLine, IsWholeThoughOnlyAPartIsWrittenAtOnce) {
  for (const size_t part : {size_t{1}, size_t{7}}) {
    EXPECT_EQ(texts(standardError("all", nullptr,
                                  [part] {
                                    longest_write = part;
                                    loaded.printDebug(kOrdinary,
                                                      "a text of more than 7 characters");
                                    longest_write = 0;
                                  })),
              std::vector<std::string>{"a text of more than 7 characters"});
  }
}

// In a storm of signals.
TEST(PrintedLine, IsWholeInASlowTerminalAmidSignals) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  for (const int flags : {0, SA_RESTART}) {
    const TempDir temp;
    const std::string received = temp.path("received");
    constexpr int kCount = 300;
    constexpr std::string_view kEnd = "END";  // no line contains a capital letter but T and Z
    EXPECT_EQ(inChild([&] {
                load("all", nullptr);
                const Terminal terminal = openTerminal();
                termios raw = {};
                tcgetattr(terminal.subsidiary, &raw);
                cfmakeraw(&raw);
                raw.c_oflag = OPOST;
                tcsetattr(terminal.subsidiary, TCSANOW, &raw);
                std::string all;
                std::atomic<bool> is_read = false;
                std::thread reader([&] {
                  char piece[100];
                  pollfd ready{terminal.manager, POLLIN, 0};
                  while (all.find(kEnd) == std::string::npos && poll(&ready, 1, 60'000) > 0) {
                    const ssize_t got = read(terminal.manager, piece, sizeof piece);
                    if (got <= 0) break;
                    all.append(piece, static_cast<size_t>(got));
                    usleep(100);
                  }
                  is_read = true;
                });
                const int kept = dup(STDERR_FILENO);
                dup2(terminal.subsidiary, STDERR_FILENO);
                {
                  const SignalStorm storm(flags);
                  const std::string padding(500, 'p');
                  for (int i = 0; i < kCount; ++i) {
                    loaded.printDebug(kOrdinary, "%d %s", i, padding.c_str());
                  }
                }
                dup2(kept, STDERR_FILENO);
                // The kernel may keep the last bytes until more are written.
                do {
                  EXPECT_EQ(write(terminal.subsidiary, kEnd.data(), kEnd.size()),
                            ssize_t(kEnd.size()));
                  usleep(10'000);
                } while (!is_read);
                reader.join();
                EXPECT_THAT(all, HasSubstr(kEnd));
                writeFile(received, all.substr(0, all.find(kEnd)));
                return 0;
              }),
              0);
    const std::vector<std::string> found = texts(contentsOf(received));
    ASSERT_EQ(found.size(), static_cast<size_t>(kCount));
    for (int i = 0; i < kCount; ++i) {
      EXPECT_EQ(found[static_cast<size_t>(i)], std::to_string(i) + " " + std::string(500, 'p'));
    }
  }
}

TEST(PrintedLine, ATextThatCannotBeFormattedShowsItsFormat) {
  EXPECT_THAT(texts(standardError("all", nullptr,
                                  [] { loaded.printDebug(kOrdinary, "name %ls", L"\u00e9"); })),
              ElementsAre("name %ls"));
}

TEST(PrintedLine, ANullFormatPrintsNothing) {
  const char* const format = nullptr;
  EXPECT_EQ(standardError("all", nullptr, [&] { printVa(kOrdinary, format); }), "");
}

TEST(Caller, KeepsItsErrnoWhichTheTextMayShow) {
  const std::string printed = standardError("all", nullptr, [] {
    const std::string padding(1500, ' ');  // long enough to need an allocation
    errno = ENOENT;
    printVa(kOrdinary, "%m.");
    EXPECT_EQ(errno, ENOENT);
    errno = EACCES;
    printVa(kOrdinary, "%s%m.", padding.c_str());
    EXPECT_EQ(errno, EACCES);
    close(STDERR_FILENO);
    loaded.printDebug(kOrdinary, "lost");
    EXPECT_EQ(errno, EACCES);
    EXPECT_EQ(loaded.readLdapDebug(), 1);
    EXPECT_EQ(errno, EACCES);
  });
  const std::vector<std::string> found = texts(printed);
  ASSERT_EQ(found.size(), 2U);
  EXPECT_EQ(found[0], "No such file or directory.");
  EXPECT_THAT(found[1], HasSubstr(" Permission denied."));
}

void printShortAndLong() {
  loaded.printDebug(kOrdinary, "one");
  loaded.printDebug(kOrdinary, "%s", std::string(1500, '2').c_str());  // needs an allocation
  loaded.printDebug(kOrdinary, "three");
}

TEST(Caller, ThatIsCancelledFinishesItsLine) {
  const std::string printed = standardError("all", nullptr, [] {
    pthread_t thread;
    ASSERT_EQ(pthread_create(
                  &thread, nullptr,
                  [](void*) -> void* {
                    is_cancellation_point = true;
                    pthread_cancel(pthread_self());
                    printShortAndLong();
                    pthread_testcancel();
                    return nullptr;
                  },
                  nullptr),
              0);
    void* result = nullptr;
    pthread_join(thread, &result);
    EXPECT_EQ(result, PTHREAD_CANCELED);
  });
  EXPECT_THAT(texts(printed), ElementsAre("one", std::string(1500, '2'), "three"));
}

TEST(Caller, MayHaveTheSmallestStack) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "instrumented frames are larger";
#endif
  const std::string printed = standardError("all", nullptr, [] {
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    ASSERT_EQ(pthread_attr_setstacksize(&attributes, static_cast<size_t>(PTHREAD_STACK_MIN)), 0);
    pthread_t thread;
    ASSERT_EQ(pthread_create(
                  &thread, &attributes,
                  [](void*) -> void* {
                    volatile char used_by_callers[6 << 10];
                    used_by_callers[0] = 's';
                    loaded.printDebug(kOrdinary, "%chort %d", used_by_callers[0], 15);
                    static const std::string kLong(5000, 'l');
                    loaded.printDebug(kOrdinary, "%s", kLong.c_str());
                    return nullptr;
                  },
                  nullptr),
              0);
    pthread_join(thread, nullptr);
  });
  const std::vector<std::string> found = texts(printed);
  ASSERT_GE(found.size(), 2U);
  EXPECT_EQ(found[0], "short 15");
}

TEST(Caller, GetsNoSignalFromAPipeThatNobodyReads) {
  EXPECT_EQ(inChild([] {
              load("all", nullptr);
              int ends[2];
              EXPECT_EQ(pipe(ends), 0);
              EXPECT_EQ(dup2(ends[1], STDERR_FILENO), STDERR_FILENO);
              close(ends[0]);
              signal(SIGPIPE, SIG_DFL);
              loaded.printDebug(kOrdinary, "nobody reads this");
              sigset_t set;
              sigpending(&set);
              EXPECT_EQ(sigismember(&set, SIGPIPE), 0);
              pthread_sigmask(SIG_BLOCK, nullptr, &set);
              EXPECT_EQ(sigismember(&set, SIGPIPE), 0);
              return 0;
            }),
            0);
}

TEST(Caller, KeepsASignalThatWasAlreadyWaiting) {
  EXPECT_EQ(inChild([] {
              load("all", nullptr);
              int ends[2];
              EXPECT_EQ(pipe(ends), 0);
              EXPECT_EQ(dup2(ends[1], STDERR_FILENO), STDERR_FILENO);
              close(ends[0]);
              sigset_t pipe_signal;
              sigemptyset(&pipe_signal);
              sigaddset(&pipe_signal, SIGPIPE);
              pthread_sigmask(SIG_BLOCK, &pipe_signal, nullptr);
              raise(SIGPIPE);
              loaded.printDebug(kOrdinary, "nobody reads this");
              sigset_t pending;
              sigpending(&pending);
              EXPECT_EQ(sigismember(&pending, SIGPIPE), 1);
              return 0;
            }),
            0);
}

int signals_handled;

TEST(Caller, KeepsASignalThatSomebodySendsWhileItPrints) {
  EXPECT_EQ(texts(standardError("all", nullptr,
                                [] {
                                  signals_handled = 0;
                                  (void)signal(SIGPIPE, [](int) { ++signals_handled; });
                                  is_signalled = true;
                                  loaded.printDebug(kOrdinary, "text");
                                  is_signalled = false;
                                  EXPECT_EQ(signals_handled, 1);
                                })),
            std::vector<std::string>{"text"});
}

TEST(Caller, GetsNoSignalFromAFileThatMayNotGrow) {
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(inChild([&] {
              load("all", file.c_str());
              signal(SIGXFSZ, SIG_DFL);
              loaded.printDebug(kOrdinary, "fits");
              rlimit limit = {};
              EXPECT_EQ(getrlimit(RLIMIT_FSIZE, &limit), 0);
              const rlimit before = limit;
              limit.rlim_cur = 8;
              EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
              loaded.printDebug(kOrdinary, "does not");
              EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &before), 0);
              return 0;
            }),
            0);
  EXPECT_THAT(texts(contentsOf(file)), ElementsAre("fits"));
}

TEST(File, IsMadeForTheOwnerAloneAndHoldsWhatIsPrinted) {
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(standardError("all", file.c_str(),
                          [&] {
                            umask(0);
                            printBothLevels();
                          }),
            "");
  EXPECT_THAT(texts(contentsOf(file)),
              ElementsAre("ordinary 1", "error 2", "ordinary 3", "error 4"));
  EXPECT_EQ(modeOf(file), 0600U);
}

TEST(File, GoesOnWhenTheLibraryIsClosedAndOpenedAgain) {
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(standardError(nullptr, nullptr,
                          [&] {
                            setenv("PRINT_DEBUG", "all", 1);
                            setenv("PRINT_DEBUG_FILE", file.c_str(), 1);
                            const TempDir library;
                            const std::string copy = copyInto(library);
                            for (int number = 0; number < 3; ++number) {
                              void* const handle = openLibrary(copy);
                              const int descriptors = openDescriptors();
                              loaded.printDebug(kOrdinary, "%d", number);
                              dlclose(handle);
                              EXPECT_EQ(openDescriptors(), descriptors);
                            }
                          }),
            "");
  EXPECT_THAT(texts(contentsOf(file)), ElementsAre("0", "1", "2"));
}

// What other threads print to a closed stream must not go to the file.
TEST(File, OfAProgramWithoutStandardStreamsIsNeverInTheirPlace) {
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(inChild([&] {
              setSwitch("PRINT_DEBUG", "all");
              setSwitch("PRINT_DEBUG_FILE", file.c_str());
              const TempDir library;
              const std::string copy = copyInto(library);
              const int kept[] = {dup(0), dup(1), dup(2)};
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) close(stream);
              in_place_of_a_stream = false;
              (void)openLibrary(copy);
              bool is_open = false;
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) {
                is_open = is_open || fcntl(stream, F_GETFD) != -1;
              }
              for (int stream = 0; stream <= STDERR_FILENO; ++stream) dup2(kept[stream], stream);
              EXPECT_FALSE(is_open);
              EXPECT_FALSE(in_place_of_a_stream);
              loaded.printDebug(kOrdinary, "here");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(contentsOf(file)), ElementsAre("here"));
}

// The file is opened while another thread closes or opens a stream.
TEST(File, IsNotInThePlaceOfAStreamThatChangesMeanwhile) {
  for (const int stream : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
    SCOPED_TRACE(stream);
    const TempDir temp;
    const std::string file = temp.path("log");
    EXPECT_EQ(inChild([&] {
                setSwitch("PRINT_DEBUG", "all");
                setSwitch("PRINT_DEBUG_FILE", file.c_str());
                const TempDir library;
                const std::string copy = copyInto(library);
                const int kept[] = {dup(0), dup(1), dup(2)};
                for (int each = 0; each <= STDERR_FILENO; ++each) close(each);
                lost_stream = stream;
                const int opened = stream == STDIN_FILENO ? STDOUT_FILENO : STDIN_FILENO;
                new_stream = opened;
                (void)openLibrary(copy);
                lost_stream = new_stream = -1;
                std::vector<int> open_streams;
                for (int each = 0; each <= STDERR_FILENO; ++each) {
                  if (fcntl(each, F_GETFD) != -1) open_streams.push_back(each);
                }
                for (int each = 0; each <= STDERR_FILENO; ++each) dup2(kept[each], each);
                EXPECT_THAT(open_streams, ElementsAre(opened));
                const int descriptor = descriptorOf(file);
                EXPECT_GT(descriptor, STDERR_FILENO);
                EXPECT_EQ(fcntl(descriptor, F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
                loaded.printDebug(kOrdinary, "here");
                return 0;
              }),
              0);
    EXPECT_THAT(texts(contentsOf(file)), ElementsAre("here"));
  }
}

TEST(File, OfTheEmptyNameIsStandardError) {
  EXPECT_THAT(texts(standardError("all", "", [] { loaded.printDebug(kOrdinary, "here"); })),
              ElementsAre("here"));
}

TEST(File, AnExistingOneIsLeftAloneAndStandardErrorSaysSo) {
  const TempDir temp;
  const std::string file = temp.file("log", "before");
  EXPECT_THAT(
      texts(standardError("all", file.c_str(), [] { loaded.printDebug(kOrdinary, "message"); })),
      ElementsAre("PRINT_DEBUG_FILE: " + file + " cannot be made: File exists", "message"));
  EXPECT_EQ(contentsOf(file), "before");
}

TEST(File, NoLinkIsFollowed) {
  const TempDir temp;
  const std::string existing = temp.file("existing", "before");
  const std::string missing = temp.path("missing");
  for (const std::string& target : {existing, missing}) {
    SCOPED_TRACE(target);
    const std::string link = target + ".link";
    ASSERT_EQ(symlink(target.c_str(), link.c_str()), 0);
    const std::vector<std::string> found =
        texts(standardError("all", link.c_str(), [] { loaded.printDebug(kOrdinary, "message"); }));
    ASSERT_EQ(found.size(), 2U);
    EXPECT_EQ(found[1], "message");
  }
  EXPECT_EQ(contentsOf(existing), "before");
  EXPECT_FALSE(pathExists(missing));
}

TEST(File, ThatCannotBeMadeLeavesStandardError) {
  EXPECT_THAT(texts(standardError("error", "/nonexistent/log",
                                  [] { loaded.printDebug(kError, "message"); })),
              ElementsAre("PRINT_DEBUG_FILE: /nonexistent/log cannot be made: "
                          "No such file or directory",
                          "message"));
}

TEST(File, IsNotInheritedByAProgramThatIsStarted) {
  const TempDir temp;
  const std::string file = temp.path("log");
  (void)standardError("all", file.c_str(), [&] {
    EXPECT_EQ(fcntl(descriptorOf(file), F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
  });
}

TEST(File, WhoseDescriptorNowMeansAnotherFileIsNotPrintedTo) {
  const TempDir temp;
  const std::string file = temp.path("log");
  const std::string other = temp.path("other");
  const std::string input = temp.file("input", "");
  const std::string error = standardError("all", file.c_str(), [&] {
    EXPECT_EQ(dup2(open(input.c_str(), O_RDWR), STDIN_FILENO), STDIN_FILENO);
    loaded.printDebug(kOrdinary, "one");
    const int taken = open(other.c_str(), O_WRONLY | O_CREAT, 0600);
    const int descriptor = descriptorOf(file);
    EXPECT_EQ(dup2(taken, descriptor), descriptor);
    loaded.printDebug(kOrdinary, "two");
  });
  EXPECT_THAT(texts(contentsOf(file)), ElementsAre("one"));
  EXPECT_EQ(contentsOf(other), "");
  EXPECT_EQ(contentsOf(input), "");
  EXPECT_THAT(texts(error), IsEmpty());  // its descriptor may be another file's, too
}

TEST(File, WhoseDescriptorNowMeansAFileOfTheSameNumberElsewhereIsNotPrintedTo) {
  REQUIRE_ROOT("to mount file systems");
  const TempDir temp;
  const std::string disks[] = {temp.dir("a"), temp.dir("b")};
  EXPECT_EQ(withPrivateMounts([&] {
              for (const std::string& disk : disks) {
                if (mount("osutils-test", disk.c_str(), "tmpfs", 0, "mode=0755") != 0) return 1;
              }
              const std::string file = disks[0] + "/log";
              const std::string other = disks[1] + "/other";
              (void)standardError("all", file.c_str(), [&] {
                const int taken = open(other.c_str(), O_WRONLY | O_CREAT, 0600);
                const int descriptor = descriptorOf(file);
                struct stat ours = {};
                struct stat theirs = {};
                EXPECT_EQ(fstat(descriptor, &ours), 0);
                EXPECT_EQ(fstat(taken, &theirs), 0);
                EXPECT_EQ(ours.st_ino, theirs.st_ino);  // the first file of each
                EXPECT_EQ(dup2(taken, descriptor), descriptor);
                loaded.printDebug(kOrdinary, "text");
              });
              EXPECT_EQ(contentsOf(other), "");
              return testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(StandardError, IsWhateverHasItsNumber) {
  const TempDir temp;
  const std::string other = temp.file("other", "");
  EXPECT_THAT(texts(standardError("all", nullptr,
                                  [&] {
                                    loaded.printDebug(kOrdinary, "one");
                                    close(STDERR_FILENO);
                                    loaded.printDebug(kOrdinary, "lost");
                                    EXPECT_EQ(open(other.c_str(), O_WRONLY), STDERR_FILENO);
                                    loaded.printDebug(kOrdinary, "two");
                                  })),
              ElementsAre("one"));
  EXPECT_THAT(texts(contentsOf(other)), ElementsAre("two"));
}

TEST(File, AForkedChildAppendsUnderItsOwnNumber) {
  const TempDir temp;
  const std::string file = temp.path("log");
  const std::string numbers = temp.path("numbers");
  EXPECT_EQ(standardError("all", file.c_str(),
                          [&] {
                            loaded.printDebug(kOrdinary, "parent");
                            const pid_t child = fork();
                            if (child == 0) {
                              loaded.printDebug(kOrdinary, "child");
                              _exit(0);
                            }
                            int status = -1;
                            EXPECT_EQ(waitpid(child, &status, 0), child);
                            EXPECT_EQ(status, 0);
                            loaded.printDebug(kOrdinary, "parent again");
                            writeFile(numbers, std::to_string(child));
                          }),
            "");
  const std::vector<Line> found = lines(contentsOf(file));
  ASSERT_EQ(found.size(), 3U);
  EXPECT_EQ(found[1].text, "child");
  EXPECT_EQ(std::to_string(found[1].process), contentsOf(numbers));
  EXPECT_EQ(found[2].text, "parent again");
  EXPECT_EQ(found[2].process, found[0].process);
}

// 8 threads print numbered texts; every second text is longer than a line.
void printFromManyThreads(int count) {
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 8; ++thread) {
    threads.emplace_back([thread, count] {
      const std::string padding(5000, static_cast<char>('a' + thread));
      for (int number = 0; number < count; ++number) {
        loaded.printDebug(kOrdinary, "%d %d %s\n", thread, number,
                          number % 2 == 1 ? padding.c_str() : "");
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
}

// Joins the texts of each thread and expects all of them, in order.
void expectAllFromManyThreads(const std::string& printed, int count) {
  std::map<pid_t, std::string> joined;
  for (const Line& line : lines(printed)) joined[line.thread] += line.text;
  EXPECT_EQ(joined.size(), 8U);
  for (const auto& [id, text] : joined) {
    ASSERT_FALSE(text.empty());
    const int thread = text[0] - '0';
    std::string expected;
    for (int number = 0; number < count; ++number) {
      expected += std::to_string(thread) + " " + std::to_string(number);
      if (number % 2 == 1) expected += " " + std::string(5000, static_cast<char>('a' + thread));
    }
    EXPECT_TRUE(text == expected) << "thread " << thread;
  }
}

TEST(Threads, PrintWholeLinesToAFile) {
  constexpr int kCount = 500;
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(standardError("all", file.c_str(), [] { printFromManyThreads(kCount); }), "");
  expectAllFromManyThreads(contentsOf(file), kCount);
}

TEST(Threads, PrintWholeLinesToStandardError) {
  constexpr int kCount = 500;
  expectAllFromManyThreads(standardError("all", nullptr, [] { printFromManyThreads(kCount); }),
                           kCount);
}

// A long write to a pipe, unlike one to a file, may be split.
TEST(Threads, PrintWholeLinesToAPipe) {
  constexpr int kCount = 200;
  const TempDir temp;
  const std::string received = temp.path("received");
  EXPECT_EQ(inChild([&] {
              load("all", nullptr);
              int ends[2];
              EXPECT_EQ(pipe(ends), 0);
              std::string all;
              std::thread reader([&] {
                char piece[1000];
                ssize_t got;
                while ((got = read(ends[0], piece, sizeof piece)) > 0) {
                  all.append(piece, static_cast<size_t>(got));
                }
              });
              const int kept = dup(STDERR_FILENO);
              EXPECT_EQ(dup2(ends[1], STDERR_FILENO), STDERR_FILENO);
              close(ends[1]);
              printFromManyThreads(kCount);
              dup2(kept, STDERR_FILENO);  // closes the last writing end
              reader.join();
              writeFile(received, all);
              return 0;
            }),
            0);
  expectAllFromManyThreads(contentsOf(received), kCount);
}

// The child must not wait for a lock that another thread of its parent held.
TEST(Threads, ForkWhileOthersPrint) {
  const TempDir temp;
  const std::string file = temp.path("log");
  EXPECT_EQ(standardError("all", file.c_str(),
                          [] {
                            std::thread printer([] { printFromManyThreads(200); });
                            for (int i = 0; i < 50; ++i) {
                              const pid_t child = fork();
                              if (child == 0) {
                                loaded.printDebug(kOrdinary, "child");
                                // Not _exit(), where TSan would report the parent's threads.
                                syscall(SYS_exit_group, 0);
                              }
                              int status = -1;
                              EXPECT_EQ(waitpid(child, &status, 0), child);
                              EXPECT_EQ(status, 0);
                            }
                            printer.join();
                          }),
            "");
  int children = 0;
  for (const Line& line : lines(contentsOf(file))) children += line.text == "child" ? 1 : 0;
  EXPECT_EQ(children, 50);
}

}  // namespace
