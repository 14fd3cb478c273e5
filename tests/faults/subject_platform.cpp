// The calls of the bundled platform libraries fail. Records and messages go to files, and none of their
// failures has an effect on the caller of the library.
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "ldtr.h"
#include "replaced.h"
#include "subject.h"
#include "world.h"

namespace subject {
namespace {

const char* traceDirectory() { return getenv("TRC_DIR"); }

// Runs this program again with the settings, which the platform libraries read when they are loaded.
[[noreturn]] void startWithTracing(char** arguments) {
  int status = 0;
  {
    const TempDir temp;
    setenv("TRC_DIR", temp.path().c_str(), 1);
    setenv("TRC_EVENTS", "all", 1);
    setenv("PRINT_DEBUG", "all", 1);
    setenv("PRINT_DEBUG_FILE", temp.path("messages").c_str(), 1);
    const pid_t child = fork();
    if (child == 0) {
      execv("/proc/self/exe", arguments);
      _exit(127);
    }
    if (child == -1 || waitpid(child, &status, 0) != child) abort();
  }
  exit(WIFEXITED(status) ? WEXITSTATUS(status) : 1);
}

}  // namespace

void start(char** arguments) {
  if (traceDirectory() == nullptr) startWithTracing(arguments);
  faults::spareCallers();
  for (const std::string& caller : callers()) {
    if (!faults::addCaller(caller.c_str())) abort();
  }
}

std::vector<std::string> callers() {
  return {"libtrc.so",    "liborxldapdbg.so", "liborxldap.so",
          "libvrastr.so", "libmessage.so",    "libvraldapiconv.so"};
}

// The library sees only that it got no text, or that trcInit() failed.
scenarios::Kinds effectsOf(const KindOfCall& kind) {
  const bool is_seen = kind.kind == scenarios::kMemory || kind.kind == scenarios::kEnvironment ||
                       kind.kind == scenarios::kPrint;
  return scenarios::kTrace |
         (is_seen ? scenarios::kEnvironment | scenarios::kPrint : scenarios::kNothing);
}

// A process makes its trace with its first record, by the same several hundred calls whatever function
// leaves that record. So they fail in one scenario only.
struct Tracing::State {};
Tracing::Tracing(const scenarios::Scenario& scenario) {
  const std::vector<std::string> makes_trace = {"_Z10ldtr_writemmPKv"};
  if (scenario.symbols != makes_trace) ldtr_write(LDTR_TYPE_DEBUG, 1, nullptr);
}
Tracing::~Tracing() = default;

const bool kLeavesAsInScenario = false;

const bool kMakesAllCallsInRuns = false;

void removeTrace(int process) {
  const std::string own = "-" + std::to_string(process) + "-";
  for (const auto& each : std::filesystem::directory_iterator(traceDirectory())) {
    if (each.path().filename().string().find(own) != std::string::npos) {
      std::filesystem::remove_all(each.path());
    }
  }
}

}  // namespace subject
