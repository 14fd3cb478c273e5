// The checks of versions, names and addresses and the functions that cut paths, compared with models. The debug
// messages give the reason of each refusal.
//
// An input is the text, which a NUL ends, and then a list, each entry after a field separator.
#include <stdarg.h>
#include <stddef.h>

#include <algorithm>
#include <string>
#include <vector>

#include "fuzz.h"
#include "osutils.h"
#include "platform.h"
#include "version_model.h"

extern char** environ;

namespace {

std::string messages;

}  // namespace

void PrintDebugVa(unsigned int, const char*, va_list) __attribute__((format(printf, 2, 0)));
void PrintDebugVa(unsigned int, const char* format, va_list arguments) {
  char* text = nullptr;
  if (vasprintf(&text, format, arguments) == -1) giveUp("vasprintf");
  messages += text;
  free(text);
}

namespace {

std::string takeMessages() {
  std::string taken;
  taken.swap(messages);
  return taken;
}

std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

// The text at its exact size, so that the sanitizer reports reads beyond it.
class Exact {
 public:
  explicit Exact(const std::string& text) : bytes_(text.begin(), text.end()) {
    bytes_.push_back('\0');
    bytes_.shrink_to_fit();
  }
  char* get() { return bytes_.data(); }

 private:
  std::vector<char> bytes_;
};

std::string lowerCased(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

bool isOneOf(const std::string& text, const std::vector<std::string>& list) {
  return std::find(list.begin(), list.end(), text) != list.end();
}

// Why a name is refused; empty if it is not.
std::string reasonAgainst(const std::string& name) {
  static const std::string letters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";
  static const std::string others = "0123456789_";
  if (name.empty()) return "isValidName: Passed a NULL or empty name.\n";
  if (name.size() > 8) return "isValidName: Error: Length violation.\n";
  const size_t outside = name.find_first_not_of(letters + others);
  if (outside != 0 && letters.find(name[0]) == std::string::npos) {
    return "isValidName: Error: Not starting with a letter.\n";
  }
  if (outside != std::string::npos) return "isValidName: Error: Character range violation.\n";
  const std::string folded = lowerCased(name);
  if (isOneOf(folded.substr(0, 3), {"orx", "sql", "sys"})) {
    return "isValidName: Error: Cannot start with ORX, SYS or SQL.\n";
  }
  if (isOneOf(folded, {"users", "admins", "guests", "public", "local"})) {
    return "isValidName: Error: Cannot be anyone of Users, Admins, guests, public and local.\n";
  }
  return "";
}

std::string lastPart(const std::string& path) {
  const char separator = path.find('/') != std::string::npos ? '/' : '\\';
  return partsOf(path, separator).back();
}

std::string withoutLastPart(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? "" : path.substr(0, slash);
}

void compareChecks(const std::string& text) {
  const bool is_version = isVersionByModel(text);
  expectSame("isVersionValid", isVersionValid(Exact(text).get()), is_version);
  expectSame("messages of isVersionValid", takeMessages(),
             "isVersionValid: version received is " + text + "\n");

  const std::string reason = reasonAgainst(text);
  Exact name(text);
  expectSame("isValidName", isValidName(name.get()), reason.empty());
  expectSame("messages of isValidName", takeMessages(), reason);
  expectSame("the caller's name", name.get(), text);
}

void comparePaths(const std::string& text) {
  expectSame("getFileNameFromPath", taken(getFileNameFromPath(Exact(text).get())), lastPart(text));
  Exact path(text);
  char* trimmed = path.get();
  expectSame("trimLastDirectory", trimLastDirectory(&trimmed), 0);
  expectSame("trimmed path", trimmed, withoutLastPart(text));

  std::string setting = "VRA_LDAP_HOME=" + text;
  char* variables[] = {setting.data(), nullptr};
  char** const before = environ;
  environ = variables;
  std::string root = text;
  if (!root.empty() && (root.back() == '/' || root.back() == '\\')) root.pop_back();
  expectSame("getVRAInstallPath", taken(getVRAInstallPath()), root);
  expectSame("getVRAInstallLibPath", taken(getVRAInstallLibPath()), root + "/lib64");
  expectSame("getVRAVrarunFilePath", taken(getVRAVrarunFilePath()), root + "/sbin/64/vrarun");
  environ = before;
}

void compareAddresses(const std::string& text, const std::vector<std::string>& list) {
  std::vector<Exact> entries(list.begin(), list.end());
  std::vector<char*> pointers;
  bool expected = false;
  for (size_t i = 0; i < list.size(); ++i) {
    // An entry of one "0" stands for a null one.
    pointers.push_back(list[i] == "0" ? nullptr : entries[i].get());
    expected =
        expected || (!text.empty() && list[i] != "0" && lowerCased(list[i]) == lowerCased(text));
  }
  expectSame(
      "isValidIPAddressInList",
      isValidIPAddressInList(Exact(text).get(), pointers.data(), static_cast<int>(pointers.size())),
      expected);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::vector<std::string> parts;
  for (const std::string& part :
       partsOf({reinterpret_cast<const char*>(data), size}, kFieldSeparator)) {
    parts.push_back(part.substr(0, part.find('\0')));
  }
  const std::string text = parts[0];
  parts.erase(parts.begin());

  trcEvents = ~uint64_t{0};
  compareChecks(text);
  trcEvents = 0;
  comparePaths(text);
  compareAddresses(text, parts);
  return 0;
}
