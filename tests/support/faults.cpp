#include "faults.h"

#include <errno.h>
#include <link.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>

#include <atomic>
#include <functional>
#include <string_view>
#include <utility>

#include "replaced.h"

namespace {

// ---- Callers ----

struct Range {
  uintptr_t begin = 0;
  uintptr_t end = 0;
  bool is_spared = false;
};

// The code of the callers whose calls may fail.
constexpr size_t kMaxCallers = 16;
constinit Range callers[kMaxCallers];
constinit size_t caller_count = 0;

struct Wanted {
  std::string_view name;
  bool found;
};

int addCaller(dl_phdr_info* info, size_t, void* wanted) {
  auto& [name, found] = *static_cast<Wanted*>(wanted);
  const std::string_view path = info->dlpi_name;
  const std::string_view file = path.substr(path.rfind('/') + 1);
  if (name.empty() ? !path.empty() : !file.starts_with(name)) return 0;
  for (int segment = 0; segment < info->dlpi_phnum && caller_count < kMaxCallers; ++segment) {
    const ElfW(Phdr)& header = info->dlpi_phdr[segment];
    if (header.p_type == PT_LOAD && (header.p_flags & PF_X) != 0) {
      const uintptr_t begin = info->dlpi_addr + header.p_vaddr;
      callers[caller_count++] = {begin, begin + header.p_memsz, false};
      found = true;
    }
  }
  return 1;
}

// Nothing fails until this program's constructors run.
__attribute__((constructor)) void addLibrary() {
  if (!faults::addCaller("libosutils.so")) {
    fputs("this program does not use libosutils.so\n", stderr);
    abort();
  }
}

// ---- Faults of a thread ----

struct Slot {
  bool used = false;
  CallSet watched = {};
  bool armed = false;
  int error = 0;
  int nth = 0;
  int times = 0;
  const std::function<void()>* during = nullptr;
  int calls = 0;
  bool fired = false;
};

constexpr int kSlots = 32;
constinit thread_local Slot slots[kSlots] = {};

int takeSlot(Slot wanted) {
  for (int slot = 0; slot < kSlots; ++slot) {
    if (!slots[slot].used) {
      slots[slot] = wanted;
      return slot;
    }
  }
  fputs("too many faults at once\n", stderr);
  abort();
}

// ---- The functions that failed ----

// Names of replacements. All processes share the table; the names have the same address in each.
using FailedFunction = std::atomic<const char*>;
constexpr int kMaxFailedFunctions = 512;
constinit FailedFunction* failed_functions = nullptr;

void keep(const char* function) {
  if (failed_functions == nullptr) return;
  for (int i = 0; i < kMaxFailedFunctions; ++i) {
    const char* kept = nullptr;
    if (failed_functions[i].compare_exchange_strong(kept, function) || kept == function) return;
  }
}

}  // namespace

bool faults::addCaller(const char* name) {
  Wanted wanted = {name, false};
  dl_iterate_phdr(::addCaller, &wanted);
  return wanted.found;
}

void faults::spareCallers() {
  for (Range& caller : callers) caller.is_spared = true;
}

namespace {

const Range* callerAt(const void* address) {
  const auto value = reinterpret_cast<uintptr_t>(address);
  for (size_t i = 0; i < caller_count; ++i) {
    if (value >= callers[i].begin && value < callers[i].end) return &callers[i];
  }
  return nullptr;
}

}  // namespace

bool faults::isLibrary(const void* address) { return callerAt(address) != nullptr; }

faults::Fault faults::strike(Call call, const char* function, const void* caller) {
  const Range* const range = callerAt(caller);
  if (range == nullptr || range->is_spared) return {};
  Fault fault;
  for (Slot& slot : slots) {
    if (!slot.used || !slot.watched.has(call)) continue;
    ++slot.calls;
    if (!slot.armed || slot.calls < slot.nth || slot.calls - slot.nth >= slot.times) continue;
    slot.fired = true;
    if (slot.during != nullptr) {
      const int saved = errno;
      (*slot.during)();
      errno = saved;
    } else if (!fault) {
      fault = {true, slot.error};
    }
  }
  if (fault) keep(function);
  return fault;
}

void keepFailedFunctions() {
  void* const memory = mmap(nullptr, sizeof(FailedFunction) * kMaxFailedFunctions,
                            PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  if (memory == MAP_FAILED) {
    perror("mmap");
    abort();
  }
  failed_functions = static_cast<FailedFunction*>(memory);
}

std::set<std::string> failedFunctions() {
  const std::string prefix = "our_";
  std::set<std::string> names;
  for (int i = 0; i < kMaxFailedFunctions; ++i) {
    const char* const name = failed_functions[i];
    if (name == nullptr) break;
    names.insert(std::string(name).starts_with(prefix) ? name + prefix.size() : name);
  }
  return names;
}

thread_local Passed passed;

FailingCall::FailingCall(CallSet calls, int error, int nth, int times)
    : slot_(takeSlot({true, calls, true, error, nth, times, nullptr, 0, false})) {}
FailingCall::~FailingCall() { slots[slot_].used = false; }
bool FailingCall::fired() const { return slots[slot_].fired; }
int FailingCall::calls() const { return slots[slot_].calls; }
void FailingCall::disarm() { slots[slot_].armed = false; }

BeforeCall::BeforeCall(Call call, std::function<void()> during, int nth)
    : slot_(takeSlot(
          {true, call, true, 0, nth, 1, new std::function<void()>(std::move(during)), 0, false})) {}
BeforeCall::~BeforeCall() {
  slots[slot_].used = false;
  delete slots[slot_].during;
}
bool BeforeCall::fired() const { return slots[slot_].fired; }
