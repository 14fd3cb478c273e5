#include "settings.h"

#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <charconv>
#include <string_view>

#include "trace_numbers.h"

namespace trc {
namespace {

struct EventName {
  std::string_view name;
  uint64_t bits;
};

constexpr EventName kEventNames[] = {
    {"entry", trace::kEvents33},
    {"exit_error", trace::kErrorEvents33},
    {"entry43", trace::kEvents43},
    {"exit_error43", trace::kErrorEvents43},
    {"debug", trace::kDebugEvents},
    {"all", trace::kEvents33 | trace::kErrorEvents33 | trace::kEvents43 | trace::kErrorEvents43 |
                trace::kDebugEvents},
};

constexpr uint64_t kUsualLatestBytes = 64 << 20;

bool parseNumber(std::string_view text, uint64_t& out) {
  int base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
  }
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), out, base);
  return error == std::errc() && end == text.data() + text.size();
}

bool parseEvent(std::string_view word, uint64_t& out) {
  for (const EventName& event : kEventNames) {
    if (word == event.name) {
      out = event.bits;
      return true;
    }
  }
  return parseNumber(word, out);
}

std::optional<uint64_t> parseEvents(std::string_view list) {
  uint64_t all = 0;
  while (true) {
    const size_t comma = list.find(',');
    uint64_t bits;
    if (!parseEvent(list.substr(0, comma), bits)) return {};
    all |= bits;
    if (comma == std::string_view::npos) return all;
    list.remove_prefix(comma + 1);
  }
}

bool makeAbsolute(const char* path, char (&out)[PATH_MAX]) {
  size_t used = 0;
  if (path[0] != '/') {
    if (getcwd(out, sizeof out) == nullptr) return false;
    used = strlen(out);
    out[used++] = '/';  // in the place of the NUL
  }
  const size_t length = strlen(path);
  if (length >= sizeof out - used) return false;
  memcpy(out + used, path, length + 1);
  return true;
}

// A set-user-id program must not write where its user says.
const char* setting(const char* name) {
  const char* const value = secure_getenv(name);
  return value != nullptr && value[0] != '\0' ? value : nullptr;
}

}  // namespace

bool readEvents(std::optional<uint64_t>& out) {
  const char* const events = setting("TRC_EVENTS");
  if (events == nullptr) return true;
  out = parseEvents(events);
  return out.has_value();
}

bool readSettings(Settings& out) {
  out.directory[0] = '\0';
  out.keeps_latest = false;
  if (const char* const mode = setting("TRC_MODE")) {
    if (strcmp(mode, "latest") != 0) return false;
    out.keeps_latest = true;
  }
  out.max_bytes = out.keeps_latest ? kUsualLatestBytes : UINT64_MAX;
  if (!readEvents(out.events)) return false;
  if (const char* const bytes = setting("TRC_MAX_BYTES")) {
    if (!parseNumber(bytes, out.max_bytes)) return false;
  }
  const char* const directory = setting("TRC_DIR");
  return directory == nullptr || makeAbsolute(directory, out.directory);
}

}  // namespace trc
