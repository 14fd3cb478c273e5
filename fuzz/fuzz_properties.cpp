// getXQ4PathAndVersion, compared with a model.
//
// An input is one letter for each circumstance and, after a record separator, the contents of the properties file.
#include <stddef.h>

#include <optional>
#include <string>
#include <vector>

#include "fuzz.h"
#include "osutils.h"
#include "platform.h"
#include "version_model.h"

namespace {

// What PrintMessageCmdLine was called with.
std::string printed;
// The result of getShortname. Where getXQ4PathAndVersion returns null, it leaks this string deliberately.
char* short_name;

}  // namespace

int PrintMessageCmdLine(int a, int b, int c, int d, int e, const char* text) {
  for (const int number : {a, b, c, d, e}) printed += std::to_string(number) + " ";
  printed += text;
  return 0;
}

char* getShortname(const char* name) {
  short_name = strdup(name);
  return short_name;
}

namespace {

// The files of all circumstances. Those that are not asked for have other values.
struct Files {
  Files() {
    for (const std::string& file : {migration, instance, product}) {
      std::filesystem::create_directories(file.substr(0, file.rfind('/')));
      writeTo(file, kOther);
    }
    g_migBackDir = migration_folder.c_str();
    g_dirInstLocation = instance_folder.c_str();
    g_dirInstName = "inst1";
    setenv("VRA_LDAP_HOME", product_folder.c_str(), 1);
  }

  static constexpr const char* kOther = "currentXQ4InstallPath=/other\ncurrentXQ4Version=8\n";

  const Folder folder;
  const std::string migration_folder = folder.path("migration");
  const std::string instance_folder = folder.path("instance");
  const std::string product_folder = folder.path("product");
  const std::string migration = migration_folder + "/etc/xq4info";
  const std::string instance = instance_folder + "/vraslapd-inst1/etc/ldapdb.properties";
  const std::string product = product_folder + "/etc/ldapdb.properties";
};

struct Found {
  std::optional<std::string> path;
  std::optional<std::string> version;
  bool version_is_invalid = false;
};

std::string trimmed(std::string path) {
  const size_t last = path.find_last_not_of("\t\n\r ");
  path.erase(last == std::string::npos ? 0 : last + 1);
  if (path.ends_with('/') || path.ends_with('\\')) path.pop_back();
  return path;
}

Found modelOf(const std::string& contents, bool wants_version) {
  Found found;
  for (std::string line : partsOf(contents, '\n')) {
    if (line.size() > 1023) break;
    line.erase(std::min(line.find('\0'), line.size()));
    const size_t equals = line.find('=');
    if (equals == std::string::npos) continue;
    const std::string key = line.substr(0, equals);
    const std::string value = line.substr(equals + 1);
    if (!found.path && key.find("currentXQ4InstallPath") != std::string::npos) {
      found.path = value;
    } else if (wants_version && !found.version &&
               key.find("currentXQ4Version") != std::string::npos) {
      if (!isVersionByModel(value)) {
        found.version_is_invalid = true;
        break;
      }
      found.version = value;
    }
  }
  return found;
}

std::string shownVersion(const Found& found) {
  if (found.version_is_invalid) return "null";
  return found.version ? shown(*found.version) : "untouched";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const Files files;
  static char untouched[] = "";
  const std::string input(reinterpret_cast<const char*>(data), size);
  const size_t separator = std::min(input.find(kRecordSeparator), input.size());
  const std::string circumstances = input.substr(0, separator);
  const std::string contents = separator < input.size() ? input.substr(separator + 1) : "";
  const auto has = [&](char letter) { return circumstances.find(letter) != std::string::npos; };

  g_isCallerVraImigr = has('m') ? 2 : 0;
  g_loadLocalXQ4Path = has('l') ? 1 : has('L') ? 3 : 0;
  trcEvents = has('t') ? ~uint64_t{0} : 0;
  const std::string& file = has('m') ? files.migration : has('l') ? files.instance : files.product;
  writeTo(file, contents);
  const Found expected = modelOf(contents, has('v'));
  printed.clear();

  char* version = untouched;
  char* const path = getXQ4PathAndVersion(has('v') ? &version : nullptr);

  const bool is_complete = expected.path && (expected.version || !has('v'));
  expectSame("result", path == nullptr ? "null" : shown(path),
             is_complete ? shown(trimmed(*expected.path)) : "null");
  expectSame("path", short_name, trimmed(expected.path.value_or("")));
  expectSame("version",
             version == untouched ? "untouched"
             : version == nullptr ? "null"
                                  : shown(version),
             shownVersion(expected));
  expectSame("message", printed, expected.version_is_invalid ? "20 1 53 1 1 " + file : "");
  free(short_name);
  if (version != untouched) free(version);
  writeTo(file, Files::kOther);
  return 0;
}
