// Starts, kills and finds server processes; recognises the distribution and the thread library.

#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#include <atomic>

#include "cancellation.h"
#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "resumed_stream.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::OwnedStream;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

constexpr size_t kReleaseLineBytes = 256;
constexpr size_t kThreadLibraryBytes = 50;
constexpr int kFirstSuSERelease = 9;

const char* boolText(bool value) { return value ? "true" : "false"; }

bool hasMetaChars(const char* text) {
  return checkForMetaChars(const_cast<char*>(text));  // which only reads it
}

// Reads the next line without its newline and skips what does not fit, so that the rest of a long
// line is not the next line. After the last line and after a read error, lines are empty.
void readLine(FILE* stream, char (&line)[kReleaseLineBytes]) {
  // The first newline is the end of the line, even if the line contains NULs.
  memset(line, '\n', sizeof line);
  if (fgets(line, sizeof line, stream) == nullptr || ferror(stream) != 0) {
    line[0] = '\0';
    return;
  }
  char* const end = static_cast<char*>(memchr(line, '\n', sizeof line));
  if (end == nullptr) {
    for (int skipped = 0; skipped != EOF && skipped != '\n';) skipped = getc(stream);
  } else if (end + 1 != line + sizeof line && end[1] == '\0') {
    *end = '\0';
  }  // else the last line has no newline, and `end` is from memset
}

// Like fgets(), but continues after EINTR.
bool readLineRetrying(FILE* stream, char (&line)[kThreadLibraryBytes]) {
  memset(line, 0, sizeof line);  // shows how much an interrupted fgets() has read
  for (size_t length = 0;; length += strlen(line + length)) {
    if (fgets(line + length, static_cast<int>(sizeof line - length), stream) != nullptr)
      return true;
    if (ferror(stream) == 0) return length > 0;
    if (errno != EINTR) return false;
    clearerr(stream);
  }
}

// The code names of release 4 and release 5.
bool isRedHat4Or5(const char* line) {
  return strstr(line, "Nahant") != nullptr || strstr(line, "Tikanga") != nullptr;
}

bool isSuSEFrom9(const char* line) {
  DEBUG_MESSAGE(ldtr_fun, "/etc/SuSE-release: %s\n", line);
  constexpr char kVersion[] = "VERSION = ";
  const char* const version = strstr(line, kVersion);
  return version != nullptr && atoi(version + strlen(kVersion)) >= kFirstSuSERelease;
}

// Each check is made once per process. Threads that make it at the same time get the same result.
struct ReleaseCheck {
  const char* name;  // in messages
  const char* file;
  int line;  // of the file, from 1
  bool (*isMatch)(const char* line);
  std::atomic<bool> is_done = false;
  std::atomic<bool> result = false;
};
constinit ReleaseCheck red_hat{"isRedHat4_5", "/etc/redhat-release", 1, isRedHat4Or5};
// sic: the name says 9, but later releases match.
constinit ReleaseCheck suse{"isSuSE9", "/etc/SuSE-release", 2, isSuSEFrom9};

bool isRecognised(ReleaseCheck& check) {
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  DEBUG_MESSAGE(ldtr_fun, "%s() entered...\n", check.name);
  if (check.is_done) {
    DEBUG_MESSAGE(ldtr_fun, "%s() checking already done, returning %s\n", check.name,
                  boolText(check.result));
    return check.result;
  }
  struct stat64 status;
  if (stat64(check.file, &status) != 0 && errno == ENOENT) {
    DEBUG_MESSAGE(ldtr_fun, "%s() %s doesn't exist, returning %s\n", check.name, check.file,
                  boolText(check.result));
    check.is_done = true;
    return check.result;
  }
  const OwnedStream stream = osutils::openStream(check.file, "r");
  if (!stream) {
    DEBUG_MESSAGE(ldtr_fun, "%s() couldn't open %s, returning %s\n", check.name, check.file,
                  boolText(check.result));
    check.is_done = true;
    return check.result;
  }
  char line[kReleaseLineBytes];
  for (int number = 1; number <= check.line; ++number) readLine(stream.get(), line);
  if (check.isMatch(line)) check.result = true;
  DEBUG_MESSAGE(ldtr_fun, "%s() returning %s\n", check.name, boolText(check.result));
  check.is_done = true;
  return check.result;
}

}  // namespace

bool isNPTL() {
  static std::atomic<bool> usingNPTL_set = false;
  static std::atomic<bool> usingNPTL = false;

  if (usingNPTL_set) return usingNPTL;
  // A thread cancelled before it sets the flag would cause one more pipe to be leaked.
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  FILE* const pipe = popen("getconf GNU_LIBPTHREAD_VERSION", "r");
  if (pipe == nullptr) {
    ERROR_MESSAGE(ldtr_fun, "popen faild: errno=%d\n", errno);  // sic: "faild"
  } else {
    char line[kThreadLibraryBytes];
    if (readLineRetrying(pipe, line) && strstr(line, "NPTL") != nullptr) usingNPTL = true;
    // sic: leaked deliberately, because pclose() waits for getconf and collects its exit status.
  }
  usingNPTL_set = true;
  return usingNPTL;
}

TRACED int startProcess(const char* launcherDir, const char* launcherArgs) {
  TraceScope<traced::startProcess> trace;

  if (launcherDir == nullptr || launcherArgs == nullptr) {
    ERROR_MESSAGE(trace, "startProcess: A NULL pointer was passed in.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  // sic: the directory is not screened, because it is the product's own.
  if (hasMetaChars(launcherArgs)) {
    ERROR_MESSAGE(trace, "startProcess: A metacharacter was passed in.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  char* text = nullptr;
  if (vra_asprintf(&text, "%s%svrarun %s > /dev/null 2>&1", launcherDir, "/", launcherArgs) == -1) {
    DEBUG_MESSAGE(trace, "startProcess vra_asprintf failed.\n");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  const OwnedString command(text);
  DEBUG_MESSAGE(trace, "startProcess: command='%s'.\n", command.get());
  int rc = system(command.get());
  // These distributions lose the status of a successful launcher.
  if (rc == -1 && (isRecognised(red_hat) || isRecognised(suse))) rc = 0;
  return trace.result(rc);
}

TRACED int stopProcess(const char* pid) {
  TraceScope<traced::stopProcess> trace;

  if (pid == nullptr) {
    ERROR_MESSAGE(trace, "stopProcess: A NULL pointer was passed in.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (hasMetaChars(pid)) {
    ERROR_MESSAGE(trace, "stopProcess: A metacharacter was passed in.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  // sic: not checked, so 0 and negative numbers mean groups of processes.
  return trace.result(kill(atoi(pid), SIGKILL));
}

TRACED bool isProcessStarted(const char* pid, const char* programName) {
  TraceScope<traced::isProcessStarted> trace;

  // sic: both messages name stopProcess.
  if (pid == nullptr || programName == nullptr) {
    DEBUG_MESSAGE(trace, "stopProcess: A NULL pointer was passed in.\n");
    return false;
  }
  if (hasMetaChars(pid) || hasMetaChars(programName)) {
    DEBUG_MESSAGE(trace, "stopProcess: A meta character was passed in.\n");
    return false;
  }
  char* text = nullptr;
  if (vra_asprintf(&text,
                   "ps -e -o pid -o comm | grep %s[\\ ] | grep %s | grep -v \\<defunct\\> "
                   "> /dev/null 2>&1",
                   pid, programName) == -1) {
    DEBUG_MESSAGE(trace, "isProcessStarted: vra_asprintf failed.\n");
    return false;
  }
  const OwnedString command(text);
  DEBUG_MESSAGE(trace, "isProcessStarted: will run command='%s'.\n", command.get());
  return system(command.get()) == 0;
}
