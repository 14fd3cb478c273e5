// The switches of the environment.
#pragma once

#include <limits.h>
#include <stdint.h>

#include <optional>

namespace trc {

struct Settings {
  char directory[PATH_MAX];  // absolute: the program may change its working directory; "" for none
  uint64_t max_bytes;        // that the files of one process may take
  std::optional<uint64_t> events;
};

// Reads TRC_EVENTS, TRC_DIR and TRC_MAX_BYTES. Answers false when one of them cannot be understood.
bool readSettings(Settings& out);

}  // namespace trc
