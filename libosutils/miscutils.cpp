// The canonical spelling of distinguished names, and the name of the platform.

#include <string.h>
#include <strings.h>

#include <array>

#include "osutils.h"
#include "owned.h"
#include "text.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

// The formatter's states. All blanks in a type are removed, so a type needs no state for the
// characters after its first blank.
enum State {
  kBeforeType,
  kInType,
  kBeforeValue,
  kInValue,
  kInQuotes,
  kAfterQuotes,
};

// The parts of a name that are copied or dropped in one run, up to the first character with the
// part's bit in kRunEnds.
enum Run : unsigned char {
  kType = 1,
  kValue = 2,
  kQuotedValue = 4,
  kRestAfterQuotes = 8,
};

// sic: tab and carriage return are ordinary text except at the end of a name.
constexpr bool isBlank(char c) { return c == ' ' || c == '\n'; }

constexpr bool isSeparator(char c) { return c == ',' || c == ';' || c == '+'; }

constexpr std::array<unsigned char, 256> kRunEnds = [] {
  std::array<unsigned char, 256> ends{};
  for (size_t i = 0; i < ends.size(); ++i) {
    const char c = static_cast<char>(i);
    if (c == '=' || isBlank(c)) ends[i] |= kType;
    if (isSeparator(c)) ends[i] |= kValue | kRestAfterQuotes;
    if (c == '"') ends[i] |= kQuotedValue;
    if (c == '\\') ends[i] |= kValue | kQuotedValue;
    if (c == '\0') ends[i] |= kType | kValue | kQuotedValue | kRestAfterQuotes;
  }
  return ends;
}();

bool endsRun(Run run, char c) { return (kRunEnds[static_cast<unsigned char>(c)] & run) != 0; }

void copyRun(Run run, const char*& read, char*& write) {
  while (!endsRun(run, *read)) *write++ = *read++;
}

// Copies a backslash and the character that it escapes.
// sic: an escaped plus or semicolon loses its backslash, unlike an escaped comma.
// Inlined, so that the pointers stay in registers.
__attribute__((always_inline)) inline void copyEscape(const char*& read, char*& write) {
  const char escaped = read[1];
  if (escaped == '\0') {
    *write++ = *read++;
    return;
  }
  if (escaped == '\\' || escaped == '"' || escaped == '=' || escaped == ',') *write++ = '\\';
  *write++ = escaped;
  read += 2;
}

// Rewrites the name in place and returns its new end. `write` never passes `read`.
char* canonicalize(char* dn, TraceScope<traced::formatDn>& trace) {
  const char* read = dn;
  char* write = dn;
  State state = kBeforeType;
  while (*read != '\0') {
    switch (state) {
      case kBeforeType:
        if (isBlank(*read)) {
          ++read;
        } else {
          *write++ = *read++;  // the first character is part of the type, even "="
          state = kInType;
        }
        break;
      case kInType:  // a backslash escapes nothing here
        copyRun(kType, read, write);
        if (*read == '=') {
          *write++ = *read++;
          state = kBeforeValue;
        } else if (*read != '\0') {
          ++read;
        }
        break;
      case kBeforeValue:
        if (isBlank(*read)) {
          ++read;
        } else if (*read == '"') {
          *write++ = *read++;
          state = kInQuotes;
        } else {
          if (*read != '\\') *write++ = *read++;  // the first character is text, even a separator
          state = kInValue;
        }
        break;
      case kInValue:
        copyRun(kValue, read, write);
        if (*read == '\\') {
          copyEscape(read, write);
        } else if (*read != '\0') {
          while (isBlank(write[-1])) --write;  // stops at "=" at the latest
          *write++ = *read++ == '+' ? '+' : ',';
          state = kBeforeType;
        }
        break;
      case kInQuotes:
        copyRun(kQuotedValue, read, write);
        if (*read == '\\') {
          copyEscape(read, write);
        } else if (*read != '\0') {
          *write++ = *read++;
          state = kAfterQuotes;
        }
        break;
      case kAfterQuotes:  // a backslash escapes nothing here
        while (!endsRun(kRestAfterQuotes, *read)) ++read;
        if (*read != '\0') {
          *write++ = *read++;  // sic: a semicolon stays, unlike after an unquoted value
          state = kBeforeType;
        }
        break;
      default:  // Unreachable; advance so that a bug cannot loop forever.
        DEBUG_MESSAGE(trace, "formatDn: - unknown state %d\n", static_cast<int>(state));
        ++read;
    }
  }
  *write = '\0';
  return write;
}

// Removes white space of any kind from the end, except a character after a backslash, even if that
// backslash is escaped.
char* trimEnd(char* begin, char* end) {
  while (end > begin && osutils::isSpace(end[-1]) && !(end - begin > 1 && end[-2] == '\\')) --end;
  *end = '\0';
  return end;
}

// ASCII letters only: the meaning of other bytes depends on the locale.
constexpr char upperCased(char c) {
  const bool is_lower = static_cast<unsigned char>(c - 'a') < 26;
  return static_cast<char>(c - is_lower * ('a' - 'A'));
}

// In blocks of a fixed size, which compilers vectorize.
void upperCase(char* text, const char* end) {
  constexpr int kBlock = 16;
  for (; end - text >= kBlock; text += kBlock) {
    for (int i = 0; i < kBlock; ++i) text[i] = upperCased(text[i]);
  }
  for (; text != end; ++text) *text = upperCased(*text);
}

}  // namespace

TRACED char* formatDn(char* dn) {
  TraceScope<traced::formatDn> trace;

  if (dn == nullptr || *dn == '\0') return nullptr;

  char* const copy = strdup(dn);
  if (copy == nullptr) return nullptr;

  char* const written_end = canonicalize(copy, trace);
  char* const end = trimEnd(copy, written_end);
  // sic: always prints an empty pair of quotes, which keeps names out of traces.
  DEBUG_MESSAGE(trace, "formatDn \"%s\"\n", written_end);
  upperCase(copy, end);
  return copy;
}

bool compareDns(char* a, char* b) {
  const OwnedString canonical_a(formatDn(a));
  const OwnedString canonical_b(formatDn(b));
  if (!canonical_a || !canonical_b) return false;
  const size_t length = strlen(canonical_b.get());
  return strncasecmp(canonical_a.get(), canonical_b.get(), length) == 0 &&
         strlen(canonical_a.get()) == length;
}

const char* getOSname(void) { return "Linux-x64"; }
