// Distinguished names, the inittab file and the screening of text for a shell, each compared with what
// a program would do without this library.
#include <benchmark/benchmark.h>
#include <ctype.h>
#include <malloc.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#ifdef BENCH_HAS_LDAP
#include <ldap.h>
#endif

#include <array>
#include <filesystem>
#include <fstream>
#include <string>

#include "ldtr.h"
#include "osutils.h"
#include "unavailable.h"

namespace {

// ---- Distinguished names ----

constexpr char kTypicalName[] =
    "cn=John Smith,ou=Human Resources,ou=Headquarter,o=Example Industries Ltd,l=Leeds,c=GB";
static_assert(sizeof kTypicalName - 1 == 85);

// Components of 20 bytes.
std::string nameOfComponents(size_t bytes) {
  std::string name;
  name.reserve(bytes);
  for (size_t number = 1'000'000; name.size() < bytes; ++number) {
    name += "ou=Division " + std::to_string(number) + ',';
  }
  name.pop_back();
  return name;
}

// One unquoted value, in words.
std::string nameOfOneValue(size_t bytes) {
  std::string name = "cn=";
  name.reserve(bytes + 8);
  while (name.size() < bytes) name += "Lorem ipsum dolor sit amet ";
  name.resize(bytes);
  name.back() = 'x';
  return name;
}

// formatDn as a table-driven automaton: the state and the kind of the character select the action and
// the next state.
namespace automaton {

enum Kind : unsigned char { kBlank, kComma, kPlus, kEquals, kQuote, kBackslash, kOther, kKinds };
enum Action : unsigned char { kSkip, kWrite, kEndWithComma, kEndWithPlus, kUnescape };
enum State : unsigned char {
  kBeforeType,
  kInType,
  kAfterBlank,
  kBeforeValue,
  kInValue,
  kInQuotes,
  kAfterQuotes,
  kEscapeInValue,
  kEscapeInQuotes,
  kStates
};
struct Step {
  Action action;
  State next;
};

constexpr Step kSteps[kStates][kKinds] = {
    /* kBeforeType */
    {{kSkip, kBeforeType},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kInType}},
    /* kInType */
    {{kSkip, kAfterBlank},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kBeforeValue},
     {kWrite, kInType},
     {kWrite, kInType},
     {kWrite, kInType}},
    /* kAfterBlank */
    {{kSkip, kAfterBlank},
     {kWrite, kAfterBlank},
     {kWrite, kAfterBlank},
     {kWrite, kBeforeValue},
     {kWrite, kAfterBlank},
     {kWrite, kAfterBlank},
     {kWrite, kAfterBlank}},
    /* kBeforeValue */
    {{kSkip, kBeforeValue},
     {kWrite, kInValue},
     {kWrite, kInValue},
     {kWrite, kInValue},
     {kWrite, kInQuotes},
     {kWrite, kEscapeInValue},
     {kWrite, kInValue}},
    /* kInValue */
    {{kWrite, kInValue},
     {kEndWithComma, kBeforeType},
     {kEndWithPlus, kBeforeType},
     {kWrite, kInValue},
     {kWrite, kInValue},
     {kWrite, kEscapeInValue},
     {kWrite, kInValue}},
    /* kInQuotes */
    {{kWrite, kInQuotes},
     {kWrite, kInQuotes},
     {kWrite, kInQuotes},
     {kWrite, kInQuotes},
     {kWrite, kAfterQuotes},
     {kWrite, kEscapeInQuotes},
     {kWrite, kInQuotes}},
    /* kAfterQuotes */
    {{kSkip, kAfterQuotes},
     {kWrite, kBeforeType},
     {kWrite, kBeforeType},
     {kSkip, kAfterQuotes},
     {kSkip, kAfterQuotes},
     {kSkip, kAfterQuotes},
     {kSkip, kAfterQuotes}},
    /* kEscapeInValue */
    {{kUnescape, kInValue},
     {kUnescape, kInValue},
     {kUnescape, kInValue},
     {kWrite, kInValue},
     {kWrite, kInValue},
     {kWrite, kInValue},
     {kUnescape, kInValue}},
    /* kEscapeInQuotes */
    {{kUnescape, kInQuotes},
     {kUnescape, kInQuotes},
     {kUnescape, kInQuotes},
     {kWrite, kInQuotes},
     {kWrite, kInQuotes},
     {kWrite, kInQuotes},
     {kUnescape, kInQuotes}},
};

constexpr std::array<Kind, 256> kKindOf = [] {
  std::array<Kind, 256> kinds{};
  kinds.fill(kOther);
  kinds[' '] = kinds['\n'] = kBlank;
  kinds[','] = kinds[';'] = kComma;
  kinds['+'] = kPlus;
  kinds['='] = kEquals;
  kinds['"'] = kQuote;
  kinds['\\'] = kBackslash;
  return kinds;
}();

char* format(const char* dn) {
  char* const copy = strdup(dn);
  char* write = copy;
  State state = kBeforeType;
  for (const char* read = copy; *read != '\0'; ++read) {
    const char c = *read;
    const Step step = kSteps[state][kKindOf[static_cast<unsigned char>(c)]];
    switch (step.action) {
      case kSkip:
        break;
      case kWrite:
        *write++ = c;
        break;
      case kEndWithComma:
      case kEndWithPlus:
        while (write[-1] == ' ' || write[-1] == '\n') --write;
        *write++ = step.action == kEndWithPlus ? '+' : ',';
        break;
      case kUnescape:
        if (c == ',') {
          *write++ = c;
        } else {
          write[-1] = c;
        }
        break;
    }
    state = step.next;
  }
  while (write > copy && isspace(static_cast<unsigned char>(write[-1])) &&
         !(write - copy > 1 && write[-2] == '\\')) {
    --write;
  }
  *write = '\0';
  for (char* c = copy; c != write; ++c) {
    if (*c >= 'a' && *c <= 'z') *c = static_cast<char>(*c - 'a' + 'A');
  }
  return copy;
}

}  // namespace automaton

void perByte(benchmark::State& state, size_t bytes) {
  state.counters["ns_per_byte"] = benchmark::Counter(
      static_cast<double>(bytes) / 1e9,
      benchmark::Counter::kIsIterationInvariantRate | benchmark::Counter::kInvert);
}

void format(benchmark::State& state, std::string name) {
  trcEvents = 0;
  for (auto _ : state) {
    char* canonical = formatDn(name.data());
    benchmark::DoNotOptimize(canonical);
    free(canonical);
  }
  perByte(state, name.size());
}

void formatWithTable(benchmark::State& state, std::string name) {
  char* const theirs = automaton::format(name.c_str());
  char* const ours = formatDn(name.data());
  const bool equal = ours != nullptr && strcmp(theirs, ours) == 0;
  free(theirs);
  free(ours);
  if (!equal) return state.SkipWithError("the table's result is different");
  for (auto _ : state) {
    char* canonical = automaton::format(name.c_str());
    benchmark::DoNotOptimize(canonical);
    free(canonical);
  }
}

#ifdef BENCH_HAS_LDAP
void normalize(benchmark::State& state, std::string name) {
  for (auto _ : state) {
    char* canonical = nullptr;
    if (ldap_dn_normalize(name.c_str(), LDAP_DN_FORMAT_LDAPV3, &canonical, LDAP_DN_FORMAT_LDAPV3) !=
        LDAP_SUCCESS) {
      state.SkipWithError("ldap_dn_normalize() refused the name");
      break;
    }
    ldap_memfree(canonical);
  }
}
#else
void normalize(benchmark::State& state, std::string) {
  unavailable(state, "the LDAP client library is not installed");
}
#endif

BENCHMARK_CAPTURE(format, typical, kTypicalName)->Name("dn/formatDn/typical");
BENCHMARK_CAPTURE(normalize, typical, kTypicalName)->Name("dn/ldap_dn_normalize/typical");
BENCHMARK_CAPTURE(format, many, nameOfComponents(100'000))->Name("dn/formatDn/5000_components");
BENCHMARK_CAPTURE(normalize, many, nameOfComponents(100'000))
    ->Name("dn/ldap_dn_normalize/5000_components");
BENCHMARK_CAPTURE(format, value, nameOfOneValue(100'000))->Name("dn/formatDn/long_value");
BENCHMARK_CAPTURE(formatWithTable, value, nameOfOneValue(100'000))->Name("dn/table/long_value");

// Makes the name only when it is measured.
void formatLarge(benchmark::State& state, std::string (*makeName)(size_t)) {
  format(state, makeName(static_cast<size_t>(state.range(0))));
}

// The kernel's part of formatDn's time: it provides the memory of the copy.
void copyLarge(benchmark::State& state) {
  const std::string name = nameOfOneValue(static_cast<size_t>(state.range(0)));
  for (auto _ : state) {
    char* copy = strdup(name.c_str());
    benchmark::DoNotOptimize(copy);
    free(copy);
  }
  perByte(state, name.size());
}

void sizes(benchmark::internal::Benchmark* benchmark) {
  benchmark->Arg(1'000'000)->Arg(100'000'000)->Unit(benchmark::kMillisecond);
}
BENCHMARK_CAPTURE(formatLarge, value, nameOfOneValue)->Name("dn_large/value")->Apply(sizes);
BENCHMARK_CAPTURE(formatLarge, many, nameOfComponents)->Name("dn_large/components")->Apply(sizes);
BENCHMARK(copyLarge)->Name("dn_large/strdup")->Apply(sizes);

// ---- The inittab file ----

constexpr int kInittabLines = 1'000;

// Returns an empty string, or why the file cannot be written.
std::string useInittab() {
  static const std::string path = std::filesystem::temp_directory_path() / "inittab";
  std::ofstream file(path);
  for (int line = 0; line < kInittabLines; ++line) {
    file << 'v' << line << ":2345:respawn:/opt/orx/ldap/V6.1/sbin/64/vrarun server" << line
         << " -f /etc/server.conf\n";
  }
  if (!file.flush()) return "cannot write " + path;
  VRAOSUtils::EtcInittab::ETC_INITTAB_FILE = path.c_str();
  return "";
}

// The id of the last line; if it is found, all lines were read.
std::string lastId() { return "v" + std::to_string(kInittabLines - 1); }

// Without it each round gives its memory back to the kernel and asks for it again, which takes longer
// than both ways of reading.
void keepFreedMemory() { (void)mallopt(M_TRIM_THRESHOLD, 64 << 20); }

void readInittabAndFree(benchmark::State& state) {
  if (const std::string why_not = useInittab(); !why_not.empty()) {
    return unavailable(state, why_not);
  }
  trcEvents = 0;
  keepFreedMemory();
  VRAOSUtils::EtcInittab inittab;
  if (inittab.readInittab() != OSUTILS_SUCCESS ||
      !inittab.doesInittabEntryExist(lastId().c_str())) {
    return state.SkipWithError("the inittab file was not loaded");
  }
  inittab.freeInittabEntries();
  for (auto _ : state) {
    int rc = inittab.readInittab();
    benchmark::DoNotOptimize(rc);
    inittab.freeInittabEntries();
  }
}

using VRAOSUtils::InittabEntry;

// Copies the field before the next of `ends`, truncated to its width, and returns what follows it.
const char* copyField(const char* field, const char* ends, char* to, size_t width) {
  const size_t length = strcspn(field, ends);
  const size_t copied = length < width ? length : width - 1;
  memcpy(to, field, copied);
  to[copied] = '\0';
  return field[length] == '\0' ? field + length : field + length + 1;
}

InittabEntry* loadWithFgets() {
  InittabEntry* head = nullptr;
  InittabEntry** tail = &head;
  FILE* const file = fopen(VRAOSUtils::EtcInittab::ETC_INITTAB_FILE, "r");
  if (file == nullptr) return nullptr;
  char line[1024];
  while (fgets(line, sizeof line, file) != nullptr) {
    const char* field = line;
    while (isspace(static_cast<unsigned char>(*field))) ++field;
    if (!isalnum(static_cast<unsigned char>(*field))) continue;
    auto* const entry = static_cast<InittabEntry*>(malloc(sizeof(InittabEntry)));
    if (entry == nullptr) break;
    field = copyField(field, ":", entry->id, sizeof entry->id);
    field = copyField(field, ":", entry->runlevels, sizeof entry->runlevels);
    field = copyField(field, ":", entry->action, sizeof entry->action);
    copyField(field, "\n", entry->process, sizeof entry->process);
    entry->next = nullptr;
    *tail = entry;
    tail = &entry->next;
  }
  fclose(file);
  return head;
}

// Frees all records. Returns whether the last one had that id.
bool freeEndsWith(InittabEntry* entry, const std::string& id) {
  bool found = false;
  while (entry != nullptr) {
    InittabEntry* const next = entry->next;
    if (next == nullptr) found = id == entry->id;
    free(entry);
    entry = next;
  }
  return found;
}

void fgetsLoop(benchmark::State& state) {
  if (const std::string why_not = useInittab(); !why_not.empty()) {
    return unavailable(state, why_not);
  }
  const std::string last = lastId();
  keepFreedMemory();
  for (auto _ : state) {
    if (!freeEndsWith(loadWithFgets(), last)) {
      state.SkipWithError("the loop did not read every line");
      break;
    }
  }
}

BENCHMARK(readInittabAndFree)->Name("inittab/readInittab");
BENCHMARK(fgetsLoop)->Name("inittab/fgets");

// ---- Screening ----

constexpr char kMetaCharacters[] = "&;`'\"|*?~<>^()[]{}$\n\r\\";
constexpr char kCleanText[] =
    "-n -f /opt/orx/ldap/V6.1/etc/server-configuration.conf -p 3700 -h first.example ";
static_assert(sizeof kCleanText - 1 == 80);

void screen(benchmark::State& state, bool (*isRefused)(char*)) {
  std::string text = kCleanText;
  trcEvents = 0;
  for (auto _ : state) {
    bool refused = isRefused(text.data());
    benchmark::DoNotOptimize(refused);
    if (refused) return state.SkipWithError("the text is clean");
  }
}

bool hasMetaCharacters(char* text) { return strpbrk(text, kMetaCharacters) != nullptr; }

BENCHMARK_CAPTURE(screen, ours, checkForMetaChars)->Name("screening/checkForMetaChars");
BENCHMARK_CAPTURE(screen, theirs, hasMetaCharacters)->Name("screening/strpbrk");

}  // namespace
