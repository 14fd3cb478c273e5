// Screening of text that is bound for a shell.

#include <string.h>

#include "osutils.h"

namespace {

// What a shell may interpret inside a word. Blank and tab are not here: they only separate words,
// and callers pass several words on purpose.
constexpr const char kMetaCharacters[] = "&;`'\"|*?~<>^()[]{}$\n\r\\";
static_assert(sizeof kMetaCharacters - 1 == 22);

}  // namespace

bool checkForMetaChars(char* s) { return s != nullptr && strpbrk(s, kMetaCharacters) != nullptr; }

bool checkOptionsForMetaChars(int count, char** argv) {
  if (count < 1 || argv == nullptr) return false;
  // From 1 to `count` itself: the program's name is not screened, and with a main()'s own arguments
  // the last one looked at is the null that ends them.
  for (int i = 1; i <= count; ++i) {
    if (argv[i] == nullptr) return false;
    if (checkForMetaChars(argv[i])) return true;
  }
  return false;
}
