// The settings in the environment.
#pragma once

#include <limits.h>
#include <stdint.h>

#include <optional>

namespace trc {

struct Settings {
  bool isOff() const { return directory[0] == '\0'; }

  char directory[PATH_MAX];  // absolute: the program may change its working directory; "" for none
  uint64_t max_bytes;        // of all files of one process
  bool keeps_latest;         // at the bound; otherwise the oldest records stay
  std::optional<uint64_t> events;
};

// Reads TRC_EVENTS into `out`, which stays as it is if the variable is not set. Returns false if it is invalid.
bool readEvents(std::optional<uint64_t>& out);

// Reads TRC_EVENTS, TRC_DIR, TRC_MAX_BYTES and TRC_MODE into new settings. Returns false if one of them is invalid.
bool readSettings(Settings& out);

}  // namespace trc
