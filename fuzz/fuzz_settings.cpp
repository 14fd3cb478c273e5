// The trace library's settings, compared with a model.
//
// An input is the values of TRC_EVENTS, TRC_MAX_BYTES, TRC_DIR and TRC_MODE, with field separators between them. A "-"
// alone, or a missing one, stands for a variable that is unset.
#include <stddef.h>

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "fuzz.h"
#include "settings.h"

extern char** environ;

namespace {

// A decimal number, or a hexadecimal one after "0x".
std::optional<uint64_t> numberByModel(const std::string& text) {
  const bool is_hexadecimal = text.starts_with("0x") || text.starts_with("0X");
  const std::string digits = is_hexadecimal ? text.substr(2) : text;
  const std::string known = is_hexadecimal ? "0123456789abcdefABCDEF" : "0123456789";
  if (digits.empty() || digits.find_first_not_of(known) != std::string::npos) return {};
  errno = 0;
  const unsigned long long number = strtoull(digits.c_str(), nullptr, is_hexadecimal ? 16 : 10);
  if (errno != 0) return {};
  return number;
}

std::optional<uint64_t> eventsByModel(const std::string& list) {
  static const std::map<std::string, uint64_t> names = {
      {"entry", 0x1000},         {"exit_error", 0x2000}, {"entry43", 0x10000},
      {"exit_error43", 0x20000}, {"debug", 0x4000000},   {"all", 0x4033000}};
  uint64_t events = 0;
  for (const std::string& word : partsOf(list, ',')) {
    const auto name = names.find(word);
    const std::optional<uint64_t> bits = name != names.end() ? name->second : numberByModel(word);
    if (!bits) return {};
    events |= *bits;
  }
  return events;
}

// What the variables mean; nothing if one of them is invalid.
std::optional<std::string> settingsByModel(const std::string& events, const std::string& bytes,
                                           const std::string& directory, const std::string& mode) {
  if (!mode.empty() && mode != "latest") return {};
  std::string text = mode.empty() ? "events " : "latest, events ";
  if (events.empty()) {
    text += "unset";
  } else {
    const std::optional<uint64_t> bits = eventsByModel(events);
    if (!bits) return {};
    text += std::to_string(*bits);
  }
  const uint64_t usual = mode.empty() ? UINT64_MAX : 67'108'864;
  const std::optional<uint64_t> limit = bytes.empty() ? usual : numberByModel(bytes);
  if (!limit) return {};
  text += ", bytes " + std::to_string(*limit) + ", directory ";
  if (directory.empty()) return text;
  const std::string path =
      directory[0] == '/' ? directory : std::filesystem::current_path().string() + "/" + directory;
  if (path.size() >= PATH_MAX) return {};
  return text + shown(path);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::vector<std::string> values;
  for (const std::string& part :
       partsOf({reinterpret_cast<const char*>(data), size}, kFieldSeparator)) {
    values.push_back(part.substr(0, part.find('\0')));
  }
  values.resize(4, "-");
  std::vector<std::string> settings;
  for (size_t i = 0; i < 4; ++i) {
    if (values[i] == "-") {
      values[i].clear();
    } else {
      const char* const names[] = {"TRC_EVENTS=", "TRC_MAX_BYTES=", "TRC_DIR=", "TRC_MODE="};
      settings.push_back(names[i] + values[i]);
    }
  }
  std::vector<char*> variables;
  for (std::string& setting : settings) variables.push_back(setting.data());
  variables.push_back(nullptr);
  const std::optional<std::string> expected =
      settingsByModel(values[0], values[1], values[2], values[3]);

  // Not setenv(), which keeps every value for ever.
  char** const before = environ;
  environ = variables.data();
  trc::Settings out;
  const bool valid = trc::readSettings(out);
  environ = before;

  std::string ours = "invalid";
  if (valid) {
    ours = std::string(out.keeps_latest ? "latest, " : "") + "events " +
           (out.events ? std::to_string(*out.events) : "unset") + ", bytes " +
           std::to_string(out.max_bytes) + ", directory " +
           (out.directory[0] != '\0' ? shown(out.directory) : "");
  }
  expectSame("settings", ours, expected.value_or("invalid"));
  return 0;
}
