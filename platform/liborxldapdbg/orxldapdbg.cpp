// liborxldapdbg: prints debug messages. Two environment variables control it. They are read once, when the library is
// loaded, so that a program's child processes share its file. The library is never unloaded, because it could not make
// the file a second time.
//
//   PRINT_DEBUG        all: every message; error: messages of the error level; anything else, or unset: nothing is
//                      printed or created
//   PRINT_DEBUG_FILE   the file to print to; if it is unset or empty, descriptor 2, or nothing if that is closed. The
//                      file is created with mode 0600; an existing file or a link is an error. If it cannot be
//                      created, a message on standard error says so, and the messages go there
//
// A set-user-id program ignores both. Each message is a line "TIME PROCESS THREAD TEXT" with the time in UTC. In the
// text, a backslash and every byte that is not printable ASCII is escaped as in C (\\, \n, \t, \xNN), so that a message
// cannot look like two or send a command to the terminal. Blanks and newlines at its end are dropped. A long message
// continues in further lines with the same time, process and thread. No line is longer than PIPE_BUF, so lines stay
// whole without a lock, which a forked child could find taken.
//
// errno does not change, and the program gets no SIGPIPE or SIGXFSZ.

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

// Does not change after readSettings().
constinit Settings settings{Selection::kNothing, -1, 0, 0};

// Blocks the signals that a failed write() raises in this thread, and discards those that it did raise.
class WriteSignalBlocker {
 public:
  WriteSignalBlocker() {
    sigset_t pending;
    (void)sigpending(&pending);
    (void)sigemptyset(&blocked_);
    // A signal that is already pending must reach the program.
    for (const int signal : {SIGPIPE, SIGXFSZ}) {
      if (sigismember(&pending, signal) == 0) (void)sigaddset(&blocked_, signal);
    }
    (void)pthread_sigmask(SIG_BLOCK, &blocked_, &previous_);
  }
  ~WriteSignalBlocker() { (void)pthread_sigmask(SIG_SETMASK, &previous_, nullptr); }
  WriteSignalBlocker(const WriteSignalBlocker&) = delete;
  WriteSignalBlocker& operator=(const WriteSignalBlocker&) = delete;

  // Discards the signal that comes with this error, and no other: somebody may have sent one.
  void discardSignalOf(int error) const {
    const int raised = error == EPIPE ? SIGPIPE : error == EFBIG ? SIGXFSZ : 0;
    if (sigismember(&blocked_, raised) != 1) return;
    sigset_t signals;
    (void)sigemptyset(&signals);
    (void)sigaddset(&signals, raised);
    const timespec now{};
    (void)sigtimedwait(&signals, nullptr, &now);
  }

 private:
  sigset_t blocked_;
  sigset_t previous_;
};

// Returns the descriptor to print to, or -1. A daemon may have closed all descriptors and opened another file, which
// then has the number of ours and must not be written to.
int outputDescriptor() {
  if (settings.file < 0) return STDERR_FILENO;
  struct stat64 status;
  const bool is_ours = fstat64(settings.file, &status) == 0 &&
                       status.st_dev == settings.file_device &&
                       status.st_ino == settings.file_number;
  return is_ours ? settings.file : -1;
}

// Writes "TIME PROCESS THREAD " and returns its length. Does not use gmtime_r(), whose lock a forked child may find
// taken. Not inlined and called before writeLines(), so that the stack never holds both a line and snprintf()'s frame.
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

// Writes one byte of a text, escaped if necessary, and returns how many characters that takes: at most 4.
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

// One write, so that the line stays whole. A terminal and a socket may take only a part of it when a signal arrives. A
// failure cannot be reported.
void writeLine(const WriteSignalBlocker& signals, int descriptor, const char* line, size_t length) {
  while (length > 0) {
    const ssize_t written = write(descriptor, line, length);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) {
      signals.discardSignalOf(errno);
      return;
    }
    line += written;
    length -= static_cast<size_t>(written);
  }
}

__attribute__((noinline)) void writeLines(const WriteSignalBlocker& signals, int descriptor,
                                          const char* prefix, size_t prefix_length,
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
    writeLine(signals, descriptor, line, length);
  } while (left > 0);
}

void print(const char* text) {
  size_t left = strlen(text);
  while (left > 0 && (text[left - 1] == '\n' || text[left - 1] == ' ')) --left;

  const WriteSignalBlocker signals;
  const int descriptor = outputDescriptor();
  char prefix[kPrefixBytes];
  const size_t prefix_length = writePrefix(prefix);
  writeLines(signals, descriptor, prefix, prefix_length, text, left);
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
    // Messages do not depend on the locale, so the description is not translated.
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
  // A cancelled thread would leak memory and keep its signals blocked.
  const osutils::CancellationState cancellation(PTHREAD_CANCEL_DISABLE);

  char short_text[kShortTextBytes];
  va_list again;
  va_copy(again, arguments);
  const int length = vsnprintf(short_text, sizeof short_text, format, arguments);
  if (length < 0) {
    print(format);  // better than nothing
  } else if (static_cast<size_t>(length) < sizeof short_text) {
    print(short_text);
  } else {
    saved_errno.restore();  // a "%m" means the caller's errno
    char* long_text = nullptr;
    const bool formatted = vasprintf(&long_text, format, again) >= 0;
    print(formatted ? long_text : short_text);  // the beginning if there is no memory
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
