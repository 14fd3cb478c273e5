// libmessage: one-line messages for the user of a command, on standard error.
//
// PrintMessageCmdLine(set, -, number, -, -, text) prints the message of that set and number with `text` in place of its
// "%s" (or "%1$s"). Messages come from the message catalogue "osutils", which catopen() finds (NLSPATH and the locale's
// messages; a set-user-id program ignores NLSPATH), or else from the built-in texts below. The other arguments have no
// effect.
//
// Returns 0 if the message was printed, -1 if nothing could be printed, and 1 if the message is neither catalogued nor
// built in: then its numbers and `text` are printed. A null `text` is printed as "(null)".

#include <errno.h>
#include <nl_types.h>
#include <stdio.h>

#include <new>
#include <string>
#include <utility>

#include "cancellation.h"
#include "platform.h"

namespace {

constexpr int kDatabaseSet = 20;
constexpr int kInvalidDatabaseVersion = 53;

// Puts `text` in place of the message's "%s". Returns false for a message without "%s". A catalogue is not trusted, so
// nothing in it is used as a format.
bool substitute(const char* message, const char* text, std::string* line) {
  if (message == nullptr) return false;
  const std::string pattern(message);
  for (const char* place : {"%1$s", "%s"}) {
    const size_t position = pattern.find(place);
    if (position == std::string::npos) continue;
    *line = pattern;
    line->replace(position, std::string(place).size(), text);
    return true;
  }
  return false;
}

bool substituteFromCatalogue(int set, int number, const char* text, std::string* line) {
  const nl_catd catalogue = catopen("osutils", NL_CAT_LOCALE);
  // NOLINTNEXTLINE(performance-no-int-to-ptr): the failure value that the interface defines
  if (catalogue == reinterpret_cast<nl_catd>(-1)) return false;
  const struct Closer {
    nl_catd catalogue;
    ~Closer() { (void)catclose(catalogue); }
  } closer{catalogue};
  return substitute(catgets(catalogue, set, number, nullptr), text, line);
}

const char* builtInMessage(int set, int number) {
  if (set != kDatabaseSet || number != kInvalidDatabaseVersion) return nullptr;
  return "The file %s holds an invalid database version.";
}

// The control characters of ASCII, and U+0080 to U+009F in UTF-8, become "?".
void replaceControlCharacters(std::string& text) {
  for (size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<unsigned char>(text[i]);
    const auto next = static_cast<unsigned char>(text[i + 1]);  // after the last one, a NUL
    if (byte == 0xC2 && next >= 0x80 && next < 0xA0) text.replace(i, 2, "?");
    if (byte < 0x20 || byte == 0x7F) text[i] = '?';
  }
}

// Prints one line. Names in it cannot send a command to the terminal or look like a second message.
bool printLine(std::string line) {
  while (!line.empty() && line.back() == '\n') line.pop_back();
  replaceControlCharacters(line);
  line += '\n';
  size_t written = fwrite(line.data(), 1, line.size(), stderr);
  while (written < line.size() && errno == EINTR) {
    clearerr(stderr);
    written += fwrite(line.data() + written, 1, line.size() - written, stderr);
  }
  return written == line.size();
}

}  // namespace

int PrintMessageCmdLine(int set, int, int number, int, int, const char* text) try {
  const osutils::CancellationState cancellation(PTHREAD_CANCEL_DISABLE);
  if (text == nullptr) text = "(null)";

  std::string line;
  if (substituteFromCatalogue(set, number, text, &line) ||
      substitute(builtInMessage(set, number), text, &line)) {
    return printLine(std::move(line)) ? 0 : -1;
  }
  char numbers[64];
  (void)snprintf(numbers, sizeof numbers, "Message %d of set %d: ", number, set);
  line = std::string(numbers) + text;
  return printLine(std::move(line)) ? 1 : -1;
} catch (const std::bad_alloc&) {
  return -1;
}
