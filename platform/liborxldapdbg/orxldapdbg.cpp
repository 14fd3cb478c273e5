// liborxldapdbg: prints debug messages. Two environment variables, read once, when the library is
// loaded, so that all processes forked from a program share its file. It then stays loaded, because a file
// is made once only:
//
//   PRINT_DEBUG        all: every message; error: those of the error level only; anything else, or
//                      unset: nothing is printed and nothing is created
//   PRINT_DEBUG_FILE   the file to print to; standard error when it is unset or empty: whatever then has
//                      the number 2, and nothing when nothing has it. The file is made
//                      new with mode 0600: an existing one is never written to, nor is a link followed.
//                      When it cannot be made, the messages go to standard error, after one that says so,
//                      since somebody asked for them
//
// A set-user-id program ignores both. Each message is a line "TIME PROCESS THREAD TEXT" with the time in
// UTC. In the text, a backslash and every byte that is not printable ASCII is escaped as in C (\\, \n, \t,
// \xNN), so that no message can pass for two or reach a terminal as a command; blanks and newlines at its
// end are dropped. A message that does not fit into one line goes on in further lines that begin with the
// same time, process and thread: no line is longer than what even a pipe takes in one piece, so lines
// stay whole among any threads and processes without a lock that a forked child could find taken.
//
// errno is left as it was found, and no signal comes from a pipe that nobody reads or a file that may not
// grow.

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>

#include "cancellation.h"
#include "descriptors.h"
#include "errno_saver.h"
#include "platform.h"
#include "trace_numbers.h"

namespace {

constexpr size_t kLineBytes = 2048;  // on the stack, which may be a small one
static_assert(kLineBytes <= PIPE_BUF);
constexpr size_t kPrefixBytes = 80;
constexpr size_t kShortTextBytes = 1024;

enum class Selection { kNothing, kErrors, kAll };

struct Settings {
  Selection selection;
  int file;  // -1: standard error
  dev_t file_device;
  ino_t file_number;
};

// Never changes after readSettings().
constinit Settings settings{Selection::kNothing, -1, 0, 0};

// Keeps from the program the signals that a write() can raise in the thread that calls it.
class WriteSignalBlocker {
 public:
  WriteSignalBlocker() {
    sigset_t pending;
    (void)sigpending(&pending);
    (void)sigemptyset(&blocked_);
    // One that is already waiting is not ours to swallow.
    for (const int signal : {SIGPIPE, SIGXFSZ}) {
      if (sigismember(&pending, signal) == 0) (void)sigaddset(&blocked_, signal);
    }
    (void)pthread_sigmask(SIG_BLOCK, &blocked_, &before_);
  }
  ~WriteSignalBlocker() {
    const timespec now{};
    while (sigtimedwait(&blocked_, nullptr, &now) > 0) {
    }
    (void)pthread_sigmask(SIG_SETMASK, &before_, nullptr);
  }
  WriteSignalBlocker(const WriteSignalBlocker&) = delete;
  WriteSignalBlocker& operator=(const WriteSignalBlocker&) = delete;

 private:
  sigset_t blocked_;
  sigset_t before_;
};

// The descriptor to print to, or -1. A daemon that closes every descriptor may give the number of ours to
// another file, which must not be written to. Standard error is whatever has its number.
int outputDescriptor() {
  if (settings.file < 0) return STDERR_FILENO;
  struct stat64 status;
  const bool is_ours = fstat64(settings.file, &status) == 0 &&
                       status.st_dev == settings.file_device &&
                       status.st_ino == settings.file_number;
  return is_ours ? settings.file : -1;
}

// Writes "TIME PROCESS THREAD " and returns its length. Without gmtime_r(), whose lock a forked child
// may find taken. Not inlined, and called before there is a line: snprintf() takes some stack as well.
__attribute__((noinline)) size_t writePrefix(char (&prefix)[kPrefixBytes]) {
  using namespace std::chrono;
  const auto now = floor<microseconds>(system_clock::now());
  const auto day = floor<days>(now);
  const year_month_day date(day);
  const hh_mm_ss time(now - day);
  return static_cast<size_t>(
      snprintf(prefix, sizeof prefix, "%04d-%02u-%02uT%02d:%02d:%02d.%06dZ %d %d ",
               static_cast<int>(date.year()), static_cast<unsigned int>(date.month()),
               static_cast<unsigned int>(date.day()), static_cast<int>(time.hours().count()),
               static_cast<int>(time.minutes().count()), static_cast<int>(time.seconds().count()),
               static_cast<int>(time.subseconds().count()), getpid(), gettid()));
}

// Writes one byte of a text as it appears in a line (up to 4 characters) and returns their number.
size_t escape(char byte, char* out) {
  const auto value = static_cast<unsigned char>(byte);
  if (value >= 0x20 && value < 0x7f && value != '\\') {
    *out = byte;
    return 1;
  }
  out[0] = '\\';
  if (byte == '\\' || byte == '\n' || byte == '\t') {
    out[1] = byte == '\n' ? 'n' : byte == '\t' ? 't' : '\\';
    return 2;
  }
  constexpr char kDigits[] = "0123456789abcdef";
  out[1] = 'x';
  out[2] = kDigits[value >> 4];
  out[3] = kDigits[value & 0xf];
  return 4;
}

// One write, so that the line stays whole. What becomes of it cannot be reported to anybody.
void writeLine(int descriptor, const char* line, size_t length) {
  ssize_t written;
  do {
    written = write(descriptor, line, length);
  } while (written < 0 && errno == EINTR);
}

__attribute__((noinline)) void writeLines(int descriptor, const char* prefix, size_t prefix_length,
                                          const char* text, size_t left) {
  char line[kLineBytes];
  memcpy(line, prefix, prefix_length);
  do {
    size_t length = prefix_length;
    // Room for the longest escape and the newline.
    for (; left > 0 && length + 4 + 1 <= kLineBytes; ++text, --left) {
      length += escape(*text, line + length);
    }
    line[length++] = '\n';
    writeLine(descriptor, line, length);
  } while (left > 0);
}

void print(const char* text) {
  size_t left = strlen(text);
  while (left > 0 && (text[left - 1] == '\n' || text[left - 1] == ' ')) --left;

  const WriteSignalBlocker signals;
  const int descriptor = outputDescriptor();
  if (descriptor < 0) return;
  char prefix[kPrefixBytes];
  const size_t prefix_length = writePrefix(prefix);
  writeLines(descriptor, prefix, prefix_length, text, left);
}

Selection readSelection() {
  const char* word = secure_getenv("PRINT_DEBUG");
  if (word == nullptr) return Selection::kNothing;
  if (strcmp(word, "all") == 0) return Selection::kAll;
  if (strcmp(word, "error") == 0) return Selection::kErrors;
  return Selection::kNothing;
}

__attribute__((constructor)) void readSettings() {
  settings.selection = readSelection();
  if (settings.selection == Selection::kNothing) return;
  const char* path = secure_getenv("PRINT_DEBUG_FILE");
  if (path == nullptr || path[0] == '\0') return;

  const int file = openAboveStandardStreams(
      AT_FDCWD, path, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_APPEND, S_IRUSR | S_IWUSR);
  struct stat64 status;
  if (file < 0 || fstat64(file, &status) != 0) {
    char* text = nullptr;
    // The untranslated description: what the messages look like does not depend on the locale.
    if (asprintf(&text, "PRINT_DEBUG_FILE: %s cannot be made: %s", path, strerrordesc_np(errno)) >=
        0) {
      print(text);
      free(text);
    }
    return;
  }
  settings.file = file;
  settings.file_device = status.st_dev;
  settings.file_number = status.st_ino;
}

bool isSelected(unsigned int level) {
  return settings.selection == Selection::kAll ||
         (settings.selection == Selection::kErrors && level == trace::kErrorLevel);
}

__attribute__((format(printf, 2, 0))) void printIfSelected(unsigned int level, const char* format,
                                                           va_list arguments) {
  const osutils::ErrnoSaver saved_errno;
  if (format == nullptr || !isSelected(level)) return;
  // A thread that ended in here would leave memory, and run on with its signals blocked.
  const osutils::CancellationState cancellation(PTHREAD_CANCEL_DISABLE);

  char short_text[kShortTextBytes];
  va_list again;
  va_copy(again, arguments);
  const int length = vsnprintf(short_text, sizeof short_text, format, arguments);
  if (length < 0) {
    print(format);  // says more than nothing
  } else if (static_cast<size_t>(length) < sizeof short_text) {
    print(short_text);
  } else {
    saved_errno.restore();  // a "%m" means the caller's errno
    char* long_text = nullptr;
    const bool formatted = vasprintf(&long_text, format, again) >= 0;
    print(formatted ? long_text : short_text);  // without memory, its beginning
    if (formatted) free(long_text);
  }
  va_end(again);
}

}  // namespace

__attribute__((format(printf, 2, 0))) void PrintDebugVa(unsigned int level, const char* format,
                                                        va_list arguments) {
  printIfSelected(level, format, arguments);
}

void PrintDebug(unsigned int level, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  printIfSelected(level, format, arguments);
  va_end(arguments);
}

int read_ldap_debug(void) { return settings.selection == Selection::kNothing ? 0 : 1; }
