#include "records.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>

#include <algorithm>
#include <iterator>
#include <map>
#include <mutex>
#include <optional>
#include <thread>
#include <utility>
#include <variant>

#include "faults.h"
#include "ldtr.h"
#include "platform.h"
#include "replaced.h"
#include "trace_scope.h"

#define REPLACEMENT extern "C" __attribute__((visibility("default")))

namespace {

struct Event {
  std::thread::id thread;
  std::variant<Record, Print> what;
};

std::mutex messages_mutex;
std::vector<CatalogueMessage> messages;

std::mutex events_mutex;
std::vector<Event> events;
bool active = false;

struct Function {
  unsigned long trace_class;
  trace::Recorded recorded;
  const char* name;
};

const std::map<uint64_t, Function>& functions() {
  static const std::map<uint64_t, Function> table = {
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  {osutils::traced::identifier.id, {trace_class, trace::Recorded::recorded, name}},
#include "trace_functions.def"
#undef TRACE_FUNCTION
  };
  return table;
}

void collect(std::variant<Record, Print> what) {
  const std::lock_guard lock(events_mutex);
  if (active) events.push_back({std::this_thread::get_id(), std::move(what)});
}

std::vector<Event> collected() {
  const std::lock_guard lock(events_mutex);
  return events;
}

bool isDebug(const Record& record) {
  return record.type == LDTR_TYPE_DEBUG || record.type == LDTR_TYPE_DEBUG_ERROR;
}

std::string describe(const Record& record) {
  char text[200];
  snprintf(text, sizeof text,
           "type 0x%lx id 0x%lx object %p: ", static_cast<unsigned long>(record.type),
           static_cast<unsigned long>(record.id), record.object);
  return text + record.data;
}

std::string wrong(const std::string& why, const Record& record) {
  return "? " + why + ": " + describe(record);
}

long codeOf(const Record& record) {
  long code = 0;
  if (record.data.size() == sizeof code) memcpy(&code, record.data.data(), sizeof code);
  return code;
}

bool isCodeOf(trace::Recorded recorded, long code) {
  switch (recorded) {
    case trace::Recorded::kSuccess:
    case trace::Recorded::kAnswer:
      return code == 0 || code == 1;
    case trace::Recorded::kNothing:
      return code == 0;
    case trace::Recorded::kCode:
    case trace::Recorded::kNumber:
      break;
  }
  return true;
}

// Texts of functions without a scope, which are called inside any scope or outside all; "unscoped" is
// that of tests.
bool isOfCodeWithoutScope(const std::string& text) {
  constexpr const char* kBeginnings[] = {"vra_getpwnam_uid: name=",
                                         "vra_getgrnam_gid: name=",
                                         "vra_getpwnam_homedir: name=",
                                         "ldap_getgrnam_mem: name=",
                                         "vra_get_uid: name=",
                                         "vra_get_usr_gid: name=",
                                         "vra_get_usr_name: name=",
                                         "vra_getgrgid_gid: gid=",
                                         "vra_getgrgid_name: gid=",
                                         "isRedHat4_5() ",
                                         "isSuSE9() ",
                                         "/etc/SuSE-release: ",
                                         "popen faild: ",
                                         "unscoped "};
  return std::any_of(std::begin(kBeginnings), std::end(kBeginnings),
                     [&](const char* beginning) { return text.starts_with(beginning); });
}

// Reads the events of one thread and returns the line for each.
class TrailReader {
 public:
  explicit TrailReader(bool knows_scopes) : knows_scopes_(knows_scopes) {}

  // `next` is the thread's next event. The print of the previous record has no line.
  std::optional<std::string> line(const Event& event, const Event* next) {
    if (const auto* const print = std::get_if<Print>(&event.what)) {
      if (std::exchange(print_expected_, false)) return std::nullopt;
      return "? print without its record: " + print->text;
    }
    const auto& record = std::get<Record>(event.what);
    if (record.object != nullptr) return wrong("object", record);
    if (record.rest != 0) return wrong("last four arguments", record);
    return isDebug(record) ? debugLine(record, next) : scopeLine(record);
  }

 private:
  std::string debugLine(const Record& record, const Event* next) {
    const bool is_error = record.type == LDTR_TYPE_DEBUG_ERROR;
    const unsigned long level = is_error ? LDTR_LEVEL_ERROR : LDTR_LEVEL_ORDINARY;
    const Print* const print = next == nullptr ? nullptr : std::get_if<Print>(&next->what);
    if (print == nullptr) return wrong("record without a print", record);
    print_expected_ = true;
    if (print->level != level) return wrong("print at another level", record);
    if (print->text != record.data) return wrong("print of another text", record);
    if (record.id == level) {
      if (knows_scopes_ && !open_.empty() && !isOfCodeWithoutScope(record.data)) {
        return wrong("message without the function's id", record);
      }
    } else {  // the id of a scope: the levels' low byte is 0
      if (!functions().contains(record.id)) return wrong("id of a message", record);
      if (isOfCodeWithoutScope(record.data)) return wrong("message with a function's id", record);
      if (knows_scopes_ && (open_.empty() || open_.back() != record.id)) {
        return wrong("message of a function that is not the innermost", record);
      }
    }
    return (is_error ? "E " : "D ") + record.data;
  }

  std::string scopeLine(const Record& record) {
    const auto found = functions().find(record.id);
    if (found == functions().end()) return wrong("id", record);
    const auto& [trace_class, recorded, name] = found->second;
    if (record.type == ldtr_entry_type(trace_class)) {
      open_.push_back(record.id);
      return record.hasData || !record.data.empty() ? wrong("entry with data", record)
                                                    : std::string("> ") + name;
    }
    const bool is_error = record.type == ldtr_exit_error_type(trace_class);
    if (!is_error && record.type != ldtr_exit_type(trace_class)) return wrong("type", record);
    if (record.data.size() != sizeof(long)) return wrong("size of the code", record);
    if (checksCodes && !isCodeOf(recorded, codeOf(record))) {
      return wrong("a code that the table of traced functions rules out", record);
    }
    if (knows_scopes_) {
      if (open_.empty() || open_.back() != record.id) return wrong("exit without entry", record);
      open_.pop_back();
    }
    return std::string(is_error ? "<! " : "< ") + name + " " + std::to_string(codeOf(record));
  }

  bool knows_scopes_;
  std::vector<uint64_t> open_;
  bool print_expected_ = false;
};

}  // namespace

int trcInitAnswer = 0;
int trcInitCalls = 0;
int readLdapDebugAnswer = 0;
bool checksCodes = true;
void (*atTracing)() = nullptr;

// ---- Platform functions ----

REPLACEMENT uint64_t trcEvents;
uint64_t trcEvents = 0;

REPLACEMENT int trcInit() {
  ++trcInitCalls;
  if (const auto error = STRIKE(trcInit)) return *error;
  return trcInitAnswer;
}

REPLACEMENT void trcWriteRec(uint64_t type, uint64_t id, const void* obj, uint64_t length,
                             const void* data, uint64_t a, uint64_t b, uint64_t c, uint64_t d) {
  if (atTracing != nullptr) atTracing();
  collect(Record{type, id, obj, std::string(static_cast<const char*>(data), length),
                 data != nullptr, a | b | c | d});
  errno = kErrnoAfterTracing;
}

REPLACEMENT void PrintDebugVa(unsigned int level, const char* format, va_list arguments) {
  if (atTracing != nullptr) atTracing();
  va_list again;
  va_copy(again, arguments);
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  const int length = vsnprintf(nullptr, 0, format, again);
  std::string text(length < 0 ? 0 : static_cast<size_t>(length), '\0');
  if (length >= 0) vsnprintf(text.data(), text.size() + 1, format, arguments);
#pragma GCC diagnostic pop
  va_end(again);
  collect(Print{level, text});
  errno = kErrnoAfterTracing;
}

REPLACEMENT void PrintDebug(unsigned int level, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  PrintDebugVa(level, format, arguments);
  va_end(arguments);
}

REPLACEMENT int read_ldap_debug() { return readLdapDebugAnswer; }

REPLACEMENT int PrintMessageCmdLine(int first, int second, int third, int fourth, int fifth,
                                    const char* text) {
  if (const auto error = STRIKE(PrintMessageCmdLine)) return *error;
  const std::lock_guard lock(messages_mutex);
  messages.push_back({{first, second, third, fourth, fifth}, text});
  return 0;
}

std::vector<CatalogueMessage> takeCatalogueMessages() {
  const std::lock_guard lock(messages_mutex);
  return std::exchange(messages, {});
}

// ---- Records ----

Records::Records(uint64_t mask) {
  {
    const std::lock_guard lock(events_mutex);
    if (active) ADD_FAILURE() << "only one Records at a time";
    active = true;
    events.clear();
  }
  __atomic_store_n(&trcEvents, mask, __ATOMIC_RELAXED);
}

Records::~Records() {
  __atomic_store_n(&trcEvents, 0, __ATOMIC_RELAXED);
  const std::lock_guard lock(events_mutex);
  active = false;
  events.clear();
}

std::vector<Record> Records::all() const {
  std::vector<Record> records;
  for (const Event& event : collected()) {
    if (const auto* const record = std::get_if<Record>(&event.what)) records.push_back(*record);
  }
  return records;
}

std::vector<Print> Records::prints() const {
  std::vector<Print> prints;
  for (const Event& event : collected()) {
    if (const auto* const print = std::get_if<Print>(&event.what)) prints.push_back(*print);
  }
  return prints;
}

std::vector<std::string> Records::texts() const {
  std::vector<std::string> texts;
  for (const Record& record : all()) {
    if (isDebug(record)) texts.push_back(record.data);
  }
  return texts;
}

std::vector<std::string> Records::trail() const {
  constexpr uint64_t entries = kEntryExit33 | kEntryExit43;
  const bool knows_scopes = (__atomic_load_n(&trcEvents, __ATOMIC_RELAXED) & entries) == entries;
  const std::vector<Event> in_order = collected();

  std::map<size_t, const Event*> next_of_thread;
  std::map<std::thread::id, const Event*> later;
  for (size_t at = in_order.size(); at-- > 0;) {
    const Event*& next = later[in_order[at].thread];
    next_of_thread[at] = std::exchange(next, &in_order[at]);
  }

  std::map<std::thread::id, TrailReader> readers;
  std::vector<std::string> lines;
  for (size_t at = 0; at < in_order.size(); ++at) {
    TrailReader& reader = readers.try_emplace(in_order[at].thread, knows_scopes).first->second;
    if (auto line = reader.line(in_order[at], next_of_thread[at])) {
      lines.push_back(*std::move(line));
    }
  }
  return lines;
}

long Records::exitCode() const {
  const std::vector<Record> records = all();
  for (auto record = records.rbegin(); record != records.rend(); ++record) {
    if (!isDebug(*record) && record->data.size() == sizeof(long)) return codeOf(*record);
  }
  ADD_FAILURE() << "no exit record";
  return -1;
}

void Records::clear() {
  const std::lock_guard lock(events_mutex);
  events.clear();
}
