// Preloaded into the osutils tool: sets the fault that the driver asks for, and reports whether it
// fired.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <new>
#include <optional>
#include <string>

#include "replaced.h"
#include "tool_faults.h"

namespace {

// The C++ library locks mutexes to throw exceptions, and ends the program if it cannot.
bool isLeftOut(const KindOfCall& kind) { return kind.calls.has(Call::pthread_mutex_lock); }

CallSet callsOf(size_t number) {
  CallSet calls = {};
  for (size_t i = 0; i < kAnyKind; ++i) {
    const KindOfCall& kind = kKindsOfCall[i];
    const bool is_wanted = number == kAnyKind ? !kind.calls.has(Call::message) : i == number;
    if (is_wanted && !isLeftOut(kind)) calls |= kind.calls;
  }
  return calls;
}

std::string* report_path = nullptr;
std::optional<FailingCall> counters[kKinds];
std::optional<FailingCall> fault;

__attribute__((constructor)) void start() {
  // The names of the program itself and of the shared objects that are part of the product or work
  // for it.
  for (const char* const caller :
       {"", "libstdc++.so", "libtrc.so", "liborxldapdbg.so", "libmessage.so"}) {
    (void)faults::addCaller(caller);
  }
  if (const char* const path = getenv(kReportVariable)) report_path = new std::string(path);
  size_t kind = 0;
  int error = 0;
  int nth = 0;
  int times = 0;
  const char* const wanted = getenv(kFaultVariable);
  if (wanted != nullptr && sscanf(wanted, "%zu %d %d %d", &kind, &error, &nth, &times) == 4 &&
      kind < kKinds) {
    keepFailedFunctions();
    fault.emplace(callsOf(kind), error, nth, times);
  } else {
    for (kind = 0; kind < kKinds; ++kind) counters[kind].emplace(callsOf(kind), 0, kNever);
  }
  // The programs that the tool starts run without faults.
  for (const char* const name : {"LD_PRELOAD", kFaultVariable, kReportVariable}) unsetenv(name);
}

__attribute__((destructor)) void report() {
  if (report_path == nullptr) return;
  FaultReport report = {};
  report.fired = fault && fault->fired();
  for (size_t kind = 0; kind < kKinds; ++kind) {
    if (counters[kind]) report.calls[kind] = counters[kind]->calls();
  }
  if (report.fired) {
    std::string names;
    for (const std::string& name : failedFunctions()) names += (names.empty() ? "" : " ") + name;
    names.copy(report.functions, sizeof report.functions - 1);
  }
  const int descriptor = open(report_path->c_str(), O_WRONLY | O_CLOEXEC);
  if (descriptor == -1) return;
  (void)!write(descriptor, &report, sizeof report);
  (void)close(descriptor);
}

}  // namespace

// The tool ends so where memory ends in a destructor.
EXPORTED void _exit(int status) {
  report();
  for (;;) syscall(SYS_exit_group, status);
}
