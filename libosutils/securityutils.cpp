// Checks of text that goes to a shell.

#include <string.h>

#include "osutils.h"

namespace {

// The characters that a shell may interpret inside a word. Blank and tab only separate words, and
// callers pass several words on purpose.
constexpr const char kMetaCharacters[] = "&;`'\"|*?~<>^()[]{}$\n\r\\";
static_assert(sizeof kMetaCharacters - 1 == 22);

}  // namespace

bool checkForMetaChars(char* s) { return s != nullptr && strpbrk(s, kMetaCharacters) != nullptr; }

bool checkOptionsForMetaChars(int count, char** argv) {
  if (count < 1 || argv == nullptr) return false;
  // sic: argv[count] is included; in main()'s arguments it is the final null.
  for (int i = 1; i <= count; ++i) {
    if (argv[i] == nullptr) return false;
    if (checkForMetaChars(argv[i])) return true;
  }
  return false;
}
