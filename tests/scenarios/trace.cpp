// The trace frame, AutoLock and AutoFree.

#include <dlfcn.h>
#include <errno.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdlib.h>
#include <string.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <new>
#include <thread>
#include <utility>

#include "ldtr.h"
#include "scenario.h"

namespace scenarios {
namespace {

constexpr unsigned long kId = 0x3E0F0100;
const void* const kObject = reinterpret_cast<const void*>(0x1234);
const void* const kOther = reinterpret_cast<const void*>(0x5678);
constexpr const char kFormatError[] =
    "Error - ldtr_write: Debug format error - buffer is 8192 bytes rc=";

// ---- Records ----

// `beginning` is the record without its text. Without memory there is no record, but the message.
Scenario record(const std::string& name, const std::string& symbol,
                std::function<std::string()> run, const std::string& beginning,
                const std::vector<std::string>& prints = {}) {
  const auto with = [&](std::vector<std::string> records) {
    records.insert(records.end(), prints.begin(), prints.end());
    return writes(std::move(records));
  };
  return {.name = name,
          .symbols = {symbol},
          .run = std::move(run),
          .state = shownWritten,
          .ends = {{kNothing, "", with({beginning + " text 7"})},
                   {kMemory, "", with({})},
                   {kPrint, "", with({beginning + " " + kFormatError + "-1\n"})},
                   {kPrint, "", with({beginning + " "})}}};
}

void write(unsigned long type, unsigned long id, const void* object, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  ldtr_write(type, id, object, format, arguments);
#pragma GCC diagnostic pop
  va_end(arguments);
}

Scenario textOf(const std::string& variant, size_t length, const std::string& expected,
                bool is_replaced) {
  const std::string symbol = "_Z10ldtr_writemmPKvPKc@va_list@";
  const std::string beginning = "3400000 9 0x1234 ";
  const std::string all_that_fits(std::min(length, size_t{8191}), 'x');
  std::vector<End> ends = {{kNothing, "", writes({beginning + expected})},
                           {kMemory, "", writes({})},
                           {kPrint, "", writes({beginning + kFormatError + "-1\n"})},
                           {kPrint, "", writes({beginning})}};
  // without the text that says so
  if (is_replaced) ends.push_back({kPrint, "", writes({beginning + all_that_fits})});
  return {.name = "ldtr_write, " + variant,
          .symbols = {symbol},
          .run =
              [=] {
                write(0x3400000, 9, kObject, "%s", std::string(length, 'x').c_str());
                return std::string();
              },
          .state = shownWritten,
          .ends = std::move(ends)};
}

void addWrites(std::vector<Scenario>& all) {
  all.push_back({.name = "ldtr_write, without data",
                 .symbols = {"_Z10ldtr_writemmPKv"},
                 .run =
                     [] {
                       ldtr_write(0x3200000, kId, kObject);
                       return std::string();
                     },
                 .state = shownWritten,
                 .ends = {{kNothing, "", writes({"3200000 3e0f0100 0x1234"})}}});
  all.push_back(textOf("text", 5, "xxxxx", false));
  all.push_back(textOf("text of 8192 bytes", 8192, std::string(8191, 'x'), false));
  all.push_back(textOf("text of 8193 bytes", 8193, std::string(kFormatError) + "8193\n", true));
}

void addFormatters(std::vector<Scenario>& all) {
  const auto local = [&](const std::string& variant, const std::string& symbol,
                         std::function<void(ldtr_formater_local&)> call,
                         const std::string& beginning,
                         const std::vector<std::string>& prints = {}) {
    all.push_back(record(
        "ldtr_formater_local, " + variant, symbol,
        [=] {
          ldtr_formater_local formatter(kId, 0x3400000, kObject);
          call(formatter);
          return std::string();
        },
        beginning, prints));
  };
  all.push_back({.name = "ldtr_formater_local, no data",
                 .symbols = {"_ZN19ldtr_formater_localclEv"},
                 .run =
                     [] {
                       ldtr_formater_local(kId, 0x32A0000, kObject)();
                       return std::string();
                     },
                 .state = shownWritten,
                 .ends = {{kNothing, "", writes({"32a0000 3e0f0100 0x1234"})}}});
  local(
      "text", "_ZN19ldtr_formater_localclEPKcz",
      [](ldtr_formater_local& formatter) { formatter("%s %d", "text", 7); },
      "3400000 3e0f0100 0x1234");
  local(
      "numbered text", "_ZN19ldtr_formater_localclEmPKcz",
      [](ldtr_formater_local& formatter) { formatter(0x1105, "%s %d", "text", 7); },
      "3400000 3e0f0105 0x1234");
  local(
      "new_delete", "_ZN19ldtr_formater_local10new_deleteEPKvPKcz",
      [](ldtr_formater_local& formatter) { formatter.new_delete(kOther, "%s %d", "text", 7); },
      "3400000 3e0f0100 0x5678");
  local(
      "numbered new_delete", "_ZN19ldtr_formater_local10new_deleteEmPKvPKcz",
      [](ldtr_formater_local& formatter) { formatter.new_delete(5, kOther, "%s %d", "text", 7); },
      "3400000 3e0f0105 0x5678");
  local("debug", "_ZN19ldtr_formater_local5debugEmPKcz",
        [](ldtr_formater_local& formatter) {
          formatter.debug(LDTR_LEVEL_ORDINARY, "%s %d", "text", 7);
        },
        "3400000 3e0f0100 0x1234", {"print text 7"});
  local(
      "error", "_ZN19ldtr_formater_local5debugEmPKcz",
      [](ldtr_formater_local& formatter) { formatter.debug(LDTR_LEVEL_ERROR, "%s %d", "text", 7); },
      "3070000 3e0f0100 0x1234", {"print text 7"});

  const auto global = [&](const std::string& variant, const std::string& symbol,
                          std::function<void()> call, const std::string& beginning,
                          const std::vector<std::string>& prints = {}) {
    all.push_back(record(
        "ldtr_formater_global, " + variant, symbol,
        [=] {
          call();
          return std::string();
        },
        beginning, prints));
  };
  global(
      "text", "_ZN20ldtr_formater_globalclEmPKcz",
      [] { ldtr_fun(0x3400000)(0x99, "%s %d", "text", 7); }, "3400000 99 (nil)");
  global(
      "new_delete", "_ZN20ldtr_formater_global10new_deleteEmPKvPKcz",
      [] { ldtr_fun(0x3400000).new_delete(0x99, kOther, "%s %d", "text", 7); },
      "3400000 99 0x5678");
  global("debug", "_ZN20ldtr_formater_global5debugEmPKcz",
         [] { ldtr_fun(0x3400000).debug(LDTR_LEVEL_ORDINARY, "%s %d", "text", 7); },
         "3400000 c8010000 (nil)", {"print text 7"});
  global("error", "_ZN20ldtr_formater_global5debugEmPKcz",
         [] { ldtr_fun(0x3400000).debug(LDTR_LEVEL_ERROR, "%s %d", "text", 7); },
         "3070000 c8110000 (nil)", {"print text 7"});
}

// With these bits of trcEvents during the call.
Scenario exitRecord(const std::string& variant, unsigned long events, long code,
                    const std::string& type) {
  std::string data(sizeof code, '\0');
  memcpy(data.data(), &code, sizeof code);
  return {.name = "ldtr_exit_errcode, " + variant,
          .symbols = {"_Z17ldtr_exit_errcodemmmlPKv"},
          .run =
              [=] {
                const uint64_t before = std::exchange(trcEvents, events);
                ldtr_exit_errcode(kId, 43, LDTR_EVENT_CLASS_43, code, kObject);
                trcEvents = before;
                return std::string();
              },
          .state = shownWritten,
          .ends = {{kNothing, "", writes({type + " 3e0f0100 0x1234 " + data})}}};
}

void addScopes(std::vector<Scenario>& all) {
  all.push_back(exitRecord("success", 0x30000, 0, "32b0000"));
  all.push_back(exitRecord("failure", 0x30000, -99, "30c0000"));
  all.push_back(exitRecord("failure without error records", 0x10000, -99, "32b0000"));
  all.push_back({.name = "ldtr_function_global, code",
                 .symbols = {"_ZN20ldtr_function_global12SetErrorCodeEl"},
                 .run = [] { return std::to_string(ldtr_fun.SetErrorCode(89)); },
                 .ends = {{kNothing, "89"}}});
  all.push_back({.name = "ldtr_init",
                 .symbols = {"_Z9ldtr_initv"},
                 .run = [] { return shown(ldtr_init()); },
                 .ends = {{kNothing, "0"}, {kTrace, Expected([](const std::string& result) {
                                              return result != "0";
                                            })}}});
}

// ---- safer_vsprintf ----

int print(int size, char* destination, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  const int result = safer_vsprintf(size, destination, format, arguments);
#pragma GCC diagnostic pop
  va_end(arguments);
  return result;
}

// The destination has room for every text.
Scenario printed(const std::string& variant, int size, const std::string& format,
                 const std::string& argument, const std::string& text, const std::string& code) {
  return {.name = "safer_vsprintf, " + variant,
          .symbols = {"_Z14safer_vsprintfiPcPKc@va_list@"},
          .run =
              [=] {
                std::string destination(4000, '~');
                const int result =
                    print(size, destination.data(), format.c_str(), argument.c_str());
                return shown(result) + (result == 0 ? " " + std::string(destination.c_str()) : "");
              },
          .ends = {{kNothing, code + (code == "0" ? " " + text : "")}, {kPrint, "8"}}};
}

Scenario refused(const std::string& variant, std::function<int()> call, const std::string& code) {
  return {.name = "safer_vsprintf, " + variant,
          .symbols = {"_Z14safer_vsprintfiPcPKc@va_list@"},
          .run = [=] { return shown(call()); },
          .ends = {{kNothing, code}}};
}

void addPrints(std::vector<Scenario>& all) {
  all.push_back(printed("text", 100, "%%s <%s>", "text", "%s <text>", "0"));
  all.push_back(printed("empty format", 1, "", "", "", "0"));
  all.push_back(
      printed("long argument", 3000, "%s", std::string(2000, 'x'), std::string(1000, 'x'), "0"));
  all.push_back(printed("overrun", 10, "<%s>", "0123456789", "", "9"));
  all.push_back(refused(
      "null destination", [] { return print(9, nullptr, "x"); }, "1"));
  static char buffer[1000];
  all.push_back(refused(
      "no size", [] { return print(0, buffer, "x"); }, "2"));
  all.push_back(refused(
      "null format", [] { return print(9, buffer, nullptr); }, "3"));
  const std::string exact(10, 'x');
  all.push_back(refused(
      "format of the size", [=] { return print(10, buffer, exact.c_str()); }, "5"));
  const std::string overlong(500, 'x');
  all.push_back(refused(
      "long format", [=] { return print(1000, buffer, overlong.c_str()); }, "6"));
  const std::string growing = std::string(495, 'x') + "%s";
  all.push_back(refused(
      "format that grows", [=] { return print(1000, buffer, growing.c_str(), ""); }, "7"));
  all.push_back(refused(
      "text that cannot be formatted",
      [] {
        const wchar_t invalid[] = {0x7FFFFFFF, 0};
        return print(1000, buffer, "%ls", invalid);
      },
      "8"));
}

// ---- AutoLock ----

bool isFree(pthread_mutex_t* mutex) {
  const bool result = pthread_mutex_trylock(mutex) == 0;
  if (result) pthread_mutex_unlock(mutex);
  return result;
}

std::string shownIn(pthread_mutex_t* mutex) { return isFree(mutex) ? "not held" : "held"; }

class DerivedLock : public AutoLock {
 public:
  using AutoLock::AutoLock;
};

// As a local variable, as a base class and on the heap, each with another destructor.
enum class Kept { kLocal, kBase, kHeap };

std::string heldAndLeft(Kept kept, bool timed) {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  std::string result;
  if (kept == Kept::kLocal) {
    const AutoLock lock(&mutex, timed);
    result = shownIn(&mutex);
  } else if (kept == Kept::kBase) {
    const DerivedLock lock(&mutex, timed);
    result = shownIn(&mutex);
  } else {
    const std::unique_ptr<AutoLock> lock(new AutoLock(&mutex, timed));
    result = shownIn(&mutex);
  }
  return result + ", " + shownIn(&mutex);
}

// The platform's integers, which no installed header declares.
int& platformInteger(const char* name) { return *static_cast<int*>(dlsym(RTLD_DEFAULT, name)); }

// The lock type is to be read again.
void readAgain(const char* setting) {
  if (setting == nullptr) {
    unsetenv("AUTOLOCKTYPE");
  } else {
    setenv("AUTOLOCKTYPE", setting, 1);
  }
  platformInteger("al_configfile_counter") = platformInteger("configfile_read") - 1;
}

std::vector<End> locks(Left left) {
  std::vector<End> ends = {{kNothing, "held, not held", "", left},
                           {kLock, "not held, not held", "", left}};
  if (left.blocks > 0) {
    ends.push_back({kEnvironment, "held, not held"});
    ends.push_back({kEnvironment, "not held, not held"});
  }
  return ends;
}

// Another thread holds the mutex until the library has waited twice.
std::string acquiredFromAnother() {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  std::atomic<bool> is_held = false;
  std::atomic<int> waits = 0;
  std::atomic<bool> is_released = false;
  std::thread holder([&] {
    pthread_mutex_lock(&mutex);
    is_held = true;
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(150);
    while (waits < 2 && std::chrono::steady_clock::now() < end) std::this_thread::yield();
    is_released = true;
    pthread_mutex_unlock(&mutex);
  });
  while (!is_held) std::this_thread::yield();
  instead_of_waiting = [&] {
    if (++waits < 2) return;
    while (!is_released) std::this_thread::yield();
  };
  std::string result;
  try {
    const AutoLock lock(&mutex, true);
    result = is_released ? "acquired from the other" : "acquired";
  } catch (const char* text) {
    result = text;
  }
  instead_of_waiting = nullptr;
  holder.join();
  return result;
}

void addLocks(std::vector<Scenario>& all) {
  const std::vector<std::pair<Kept, std::vector<std::string>>> kinds = {
      {Kept::kLocal, {"_ZN8AutoLockC1EP15pthread_mutex_tb", "_ZN8AutoLockD1Ev"}},
      {Kept::kBase, {"_ZN8AutoLockC2EP15pthread_mutex_tb", "_ZN8AutoLockD2Ev"}},
      {Kept::kHeap, {"_ZN8AutoLockC1EP15pthread_mutex_tb", "_ZN8AutoLockD0Ev"}}};
  for (const auto& [kept, symbols] : kinds) {
    const std::string place = kept == Kept::kLocal  ? "local"
                              : kept == Kept::kBase ? "as a base"
                                                    : "on the heap";
    all.push_back({.name = "AutoLock, " + place,
                   .symbols = symbols,
                   .run = [kept = kept] { return heldAndLeft(kept, false); },
                   .ends = locks({})});
  }
  const std::vector<std::string>& symbols = kinds.front().second;
  const auto timed = [&](const std::string& variant, const char* setting, Left left) {
    all.push_back({.name = "AutoLock, timed, " + variant,
                   .symbols = symbols,
                   .run =
                       [=] {
                         readAgain(setting);
                         return heldAndLeft(Kept::kLocal, true);
                       },
                   .ends = locks(left)});
  };
  timed("unset", nullptr, {});
  timed("regular", "REGULARLOCK", {1, 0});
  timed("other", "regularlock", {1, 0});
  all.push_back({.name = "AutoLock, null",
                 .symbols = symbols,
                 .run =
                     [] {
                       { const AutoLock lock(nullptr, true); }
                       { const AutoLock lock(nullptr, false); }
                       return std::string();
                     },
                 .state = shownWritten,
                 .ends = {{kNothing, "", writes({})}}});
}

void addWaits(std::vector<Scenario>& all) {
  all.push_back({.name = "AutoLock, timed, held by another",
                 .symbols = {"_ZN8AutoLockC1EP15pthread_mutex_tb", "_ZN8AutoLockD1Ev"},
                 .run =
                     [] {
                       readAgain(nullptr);
                       return acquiredFromAnother();
                     },
                 .ends = {{kNothing, "acquired from the other"},
                          // as if there were no other thread
                          {kLock, "acquired"},
                          // all tries without a wait
                          {kClock,
                           "Couldn't get access to mutex controlled resource (wait of 60 "
                           "seconds expired.)"}},
                 .repeated = kClock});
  const auto type = [&](const std::string& variant, const char* setting, const std::string& result,
                        Left left) {
    Scenario made = {.name = "AutoLock::ReadAndSetLockType, " + variant,
                     .symbols = {"_ZN8AutoLock18ReadAndSetLockTypeEi"},
                     .run =
                         [=] {
                           readAgain(setting);
                           std::string first = shown(AutoLock::ReadAndSetLockType(7));
                           return first + ", then " + shown(AutoLock::ReadAndSetLockType(7));
                         },
                     .ends = {{kNothing, result + ", then 7", "", left}}};
    if (setting != nullptr) made.ends.push_back({kEnvironment, "1, then 7"});
    all.push_back(made);
  };
  type("unset", nullptr, "1", {});
  type("regular", "REGULARLOCK", "0", {1, 0});
  type("other", "REGULARLOCKS", "1", {1, 0});
}

// ---- AutoFree ----

int releases;
void release(void* memory) {
  ++releases;
  free(memory);
}

class DerivedBuffer : public AutoFree<char> {
 public:
  using AutoFree<char>::AutoFree;
};

char* newBlock() {
  auto* const memory = static_cast<char*>(malloc(10));
  if (memory == nullptr) throw std::bad_alloc();
  return memory;
}

std::string ownedAndReleased(Kept kept, char* memory) {
  releases = 0;
  std::string result;
  const auto look = [&](const AutoFree<char>& owner) {
    result = owner.get() == memory ? "owned, " : "lost, ";
    if (releases != 0) result += "released early, ";
  };
  if (kept == Kept::kLocal) {
    const AutoFree<char> owner(memory, release);
    look(owner);
  } else if (kept == Kept::kBase) {
    const DerivedBuffer owner(memory, release);
    look(owner);
  } else {
    const std::unique_ptr<AutoFree<char>> owner(new AutoFree<char>(memory, release));
    look(*owner);
  }
  return result + "released " + shown(releases);
}

void addBuffers(std::vector<Scenario>& all) {
  const auto buffer = [&](const std::string& variant, const std::vector<std::string>& symbols,
                          Kept kept, bool is_null, const std::string& result) {
    all.push_back({.name = "AutoFree, " + variant,
                   .symbols = symbols,
                   .run = [=] { return ownedAndReleased(kept, is_null ? nullptr : newBlock()); },
                   .ends = {{kNothing, result}}});
  };
  const std::string made = "_ZN8AutoFreeIcEC1EPcPFvPvE";
  const std::string get = "_ZNK8AutoFreeIcE3getEv";
  buffer("local", {made, "_ZN8AutoFreeIcED1Ev", get}, Kept::kLocal, false, "owned, released 1");
  buffer("as a base", {"_ZN8AutoFreeIcEC2EPcPFvPvE", "_ZN8AutoFreeIcED2Ev", get}, Kept::kBase,
         false, "owned, released 1");
  buffer("on the heap", {made, "_ZN8AutoFreeIcED0Ev", get}, Kept::kHeap, false,
         "owned, released 1");
  buffer("null", {made, "_ZN8AutoFreeIcED1Ev", get}, Kept::kLocal, true, "owned, released 0");
}

}  // namespace

std::vector<Scenario> traceScenarios() {
  std::vector<Scenario> all;
  addWrites(all);
  addFormatters(all);
  addScopes(all);
  addPrints(all);
  addLocks(all);
  addWaits(all);
  addBuffers(all);
  return all;
}

}  // namespace scenarios
