// Separators at the end of a path. A backslash is one too: tools of other platforms pass paths.
#pragma once

#include <string.h>

namespace osutils {

// sic: removes one separator only.
inline void stripTrailingSeparator(char* path) {
  const size_t length = strlen(path);
  if (length > 0 && (path[length - 1] == '/' || path[length - 1] == '\\')) path[length - 1] = '\0';
}

}  // namespace osutils
