// The separators that end a path. A backslash counts too: paths come from tools of other platforms.
#pragma once

#include <string.h>

namespace osutils {

// Removes one separator from the end of the path. One only: callers compare paths with what this
// has always left of them.
inline void dropLastSeparator(char* path) {
  const size_t length = strlen(path);
  if (length > 0 && (path[length - 1] == '/' || path[length - 1] == '\\')) path[length - 1] = '\0';
}

}  // namespace osutils
