// Environment variables, the installation's layout, the database, the time.

#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>

#include <fstream>
#include <iomanip>
#include <set>
#include <sstream>
#include <stdexcept>
#include <utility>

#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

constexpr Kinds kPrinting = kPrint | kMemory;
constexpr Kinds kReading = kEnvironment | kMemory;  // of a variable

constexpr const char kRoot[] = "/opt/orx/ldap/V6.1";

std::string quoted(const std::string& text) { return "\"" + text + "\""; }

// A result with what the variable is then. Not a state: that may be asked for in another process.
std::string withVariable(int result) {
  const char* const value = getenv("OSU_SET");
  return shown(result) + ", " + (value == nullptr ? "unset" : quoted(value));
}

void writeLines(const std::string& name, const std::string& text) {
  std::ofstream(path(name)) << text;
}

// ---- Environment variables ----

Scenario get(const std::string& variant, const char* value, const char* name,
             std::vector<End> ends) {
  return {.name = "getEnvVar" + variant,
          .symbols = {"getEnvVar"},
          .run =
              [=] {
                unsetenv("OSU_READ");
                if (value != nullptr) setenv("OSU_READ", value, 1);
                return freed(getEnvVar(name));
              },
          .ends = std::move(ends)};
}

// The assignment stays, whatever the platform says.
void setVariable(const char* name, const char* value) {
  if (setenv(name, value, 1) != 0) throw std::runtime_error(name);
}

Scenario put(const std::string& variant, const char* old, const std::string& value,
             const std::string& before) {
  return {.name = "putEnvVar" + variant,
          .symbols = {"putEnvVar"},
          .run =
              [=] {
                unsetenv("OSU_SET");
                if (old != nullptr) setVariable("OSU_SET", old);
                char name[] = "OSU_SET";
                return withVariable(putEnvVar(name, value.c_str()));
              },
          .ends = {{kNothing, "0, " + quoted(value), "", {1, 0}},
                   {kPrinting, "90, " + before},
                   {kEnvironment, "1, " + before, "", {1, 0}}}};
}

Scenario refusedPut(const std::string& variant, bool has_name, const char* value) {
  return {.name = "putEnvVar" + variant,
          .symbols = {"putEnvVar"},
          .run =
              [=] {
                setVariable("OSU_SET", "old");
                char name[] = "OSU_SET";
                return withVariable(putEnvVar(has_name ? name : nullptr, value));
              },
          .ends = {{kNothing, "89, " + quoted("old")}}};
}

void addVariables(std::vector<Scenario>& all) {
  all.push_back(get("", "value", "OSU_READ", {{kNothing, quoted("value")}, {kReading, "null"}}));
  all.push_back(get(", empty", "", "OSU_READ", {{kNothing, quoted("")}, {kReading, "null"}}));
  all.push_back(get(", unset", nullptr, "OSU_READ", {{kNothing, "null"}}));
  all.push_back(get(", null", "value", nullptr, {{kNothing, "null"}}));
  all.push_back(put("", nullptr, "value", "unset"));
  all.push_back(put(", empty", nullptr, "", "unset"));
  all.push_back(put(", replaced", "old", "new", quoted("old")));
  all.push_back(refusedPut(", null name", false, "new"));
  all.push_back(refusedPut(", null value", true, nullptr));
}

// ---- Installation layout ----

// Sets VRA_LDAP_HOME, or not.
void setHome(const char* home) {
  if (home == nullptr) {
    unsetenv("VRA_LDAP_HOME");
  } else {
    setenv("VRA_LDAP_HOME", home, 1);
  }
}

// A path below the root, without and with VRA_LDAP_HOME.
void addPath(std::vector<Scenario>& all, const std::string& symbol, std::function<char*()> call,
             const std::string& below, Left left) {
  const std::string usual = quoted(kRoot + below);
  const auto scenario = [&](const std::string& variant, const char* home,
                            const std::string& result) {
    Scenario made = {.name = symbol + variant,
                     .symbols = {symbol},
                     .run =
                         [=] {
                           setHome(home);
                           return freed(call());
                         },
                     .ends = {{kNothing, result, "", left}, {kMemory, "null"}}};
    if (!below.empty()) made.ends.push_back({kPrinting, "null", "", left});
    // A value that cannot be read is no value.
    if (home != nullptr) made.ends.push_back({kReading, usual, "", left});
    return made;
  };
  all.push_back(scenario("", nullptr, usual));
  all.push_back(scenario(", elsewhere", "/srv/osu", quoted("/srv/osu" + below)));
  all.push_back(scenario(", trailing separator", "/srv/osu/", quoted("/srv/osu" + below)));
  all.push_back(scenario(", empty root", "", quoted(below)));
}

void addLayout(std::vector<Scenario>& all) {
  addPath(all, "getVRAInstallPath", getVRAInstallPath, "", {});
  addPath(all, "getVRAInstallLibPath", getVRAInstallLibPath, "/lib64", {});
  addPath(all, "getVRAInstallSbinPath", getVRAInstallSbinPath, "/sbin", {});
  addPath(all, "getVRAVrarunFilePath", getVRAVrarunFilePath, "/sbin/64/vrarun", {});
  // The root stays allocated.
  addPath(all, "getVRABaseSchemaDirPath", [] { return getVRABaseSchemaDirPath("6.1"); },
          "/etc/SchemaV6.1", {1, 0});
  all.push_back(
      {.name = "getVRAInstallPath, one of two separators",
       .symbols = {"getVRAInstallPath"},
       .run =
           [] {
             setHome("/srv/osu\\/");
             return freed(getVRAInstallPath());
           },
       .ends = {{kNothing, quoted("/srv/osu\\")}, {kReading, quoted(kRoot)}, {kMemory, "null"}}});
  all.push_back({.name = "getVRABaseSchemaDirPath, null",
                 .symbols = {"getVRABaseSchemaDirPath"},
                 .run = [] { return freed(getVRABaseSchemaDirPath(nullptr)); },
                 .ends = {{kNothing, "null"}}});
  all.push_back({.name = "getVRAVarBasePath",
                 .symbols = {"getVRAVarBasePath"},
                 .run = [] { return freed(getVRAVarBasePath()); },
                 .ends = {{kNothing, quoted("/var/vraldap/V6.1")}, {kMemory, "null"}}});
  const std::vector<std::pair<int, std::string>> logs = {{ADMIN_LOG_XQ4, "vraadmxq4.log"},
                                                         {ADMIN_LOG_XQ4_CMDS, "vraadmxq4cmds.log"},
                                                         {ADMIN_LOG_ADM, "vraadm.log"}};
  for (const auto& [type, file] : logs) {
    all.push_back({.name = "getAdminLogsPath, " + file,
                   .symbols = {"getAdminLogsPath"},
                   .run = [type = type] { return freed(getAdminLogsPath(type)); },
                   .ends = {{kNothing, quoted("/var/vraldap/V6.1/" + file)}, {kPrinting, "null"}}});
  }
  for (const int type : {-1, 3}) {
    all.push_back({.name = "getAdminLogsPath, " + shown(type),
                   .symbols = {"getAdminLogsPath"},
                   .run = [type] { return freed(getAdminLogsPath(type)); },
                   .ends = {{kNothing, "null"}}});
  }
}

Scenario component(const std::string& variant, const char* library, std::vector<End> ends) {
  return {.name = "isRDBMComponentInstalled" + variant,
          .symbols = {"isRDBMComponentInstalled"},
          .prepare =
              [] {
                mkdir(path("lib64"), 0755);
                writeLines("lib64/libvradbutils.so", "");
                writeLines("lib64/other.so", "");
              },
          .run =
              [=] {
                setHome(path(""));
                const char* const usual = std::exchange(rdbm_lib, library);
                const bool result = isRDBMComponentInstalled();
                rdbm_lib = usual;
                return shown(result);
              },
          .ends = std::move(ends)};
}

void addComponent(std::vector<Scenario>& all) {
  const std::vector<End> found = {{kNothing, "true"},
                                  {kPrinting | kEnvironment | kStatus, "false"}};
  all.push_back(component("", "/lib64/libvradbutils.so", found));
  all.push_back(component(", another library", "/lib64/other.so", found));
  all.push_back(component(", missing", "/lib64/missing.so", {{kNothing, "false"}}));
}

// ---- Database ----

// What selects the properties file.
struct Situation {
  bool is_migration = false;
  unsigned char local = 0;
  const char* name = nullptr;
  const char* location = nullptr;
  const char* backup = nullptr;
};

// Sets the variables until the end of the scope.
class Selected {
 public:
  explicit Selected(const Situation& situation) { set(situation); }
  ~Selected() { set({}); }
  Selected(const Selected&) = delete;
  Selected& operator=(const Selected&) = delete;

 private:
  static void set(const Situation& situation) {
    g_isCallerVraImigr = situation.is_migration ? 1 : 0;
    g_loadLocalXQ4Path = situation.local;
    g_dirInstName = situation.name;
    g_dirInstLocation = situation.location;
    g_migBackDir = situation.backup;
  }
};

std::string pathAndVersion() {
  char untouched[] = "untouched";
  char* version = untouched;
  std::string result = freed(getXQ4PathAndVersion(&version));
  result += " and ";
  return result + (version == untouched ? "nothing" : freed(version));
}

constexpr const char kPathLine[] = "currentXQ4InstallPath=/opt/xq4/V9.1/ \t\r\n";
constexpr const char kVersionLine[] = "currentXQ4Version=9.1.0.2\n";
constexpr const char kBoth[] = "\"/opt/xq4/V9.1\" and \"9.1.0.2\"";

void writeProperties(const std::string& directory, const std::string& file,
                     const std::string& text) {
  if (!directory.empty()) mkdir(path(directory), 0755);
  const std::string below = directory.empty() ? "etc" : directory + "/etc";
  mkdir(path(below), 0755);
  writeLines(below + "/" + file, text);
}

// Ends without both: before the file is read, nothing is left, then the string that is not returned.
// Without memory for that, there is none.
std::vector<End> notFound(const std::string& result) {
  return {{kNothing, result, "", {1, 0}},
          {kPrinting | kStatus | kOpen, "null and nothing"},
          {kOpen | kRead, "null and nothing", "", {1, 0}},
          {kMemory, result}};
}

// Ends with both.
std::vector<End> found(const std::string& result, const std::string& version) {
  return {{kNothing, result},
          {kPrinting | kStatus | kOpen, "null and nothing"},
          {kOpen | kRead, "null and nothing", "", {1, 0}},
          // without memory for the version, and also for the string that is not returned
          {kMemory, "null and null", "", {1, 0}},
          {kMemory, "null and null"},
          // without memory for the path
          {kMemory, "null and " + version}};
}

// A scenario with the migration's file.
Scenario properties(const std::string& variant, const std::string& text, std::vector<End> ends) {
  return {.name = "getXQ4PathAndVersion, " + variant,
          .symbols = {"getXQ4PathAndVersion"},
          .prepare = [=] { writeProperties("", "xq4info", text); },
          .run =
              [] {
                const Selected selected({.is_migration = true, .backup = path("")});
                return pathAndVersion();
              },
          .ends = std::move(ends),
          .repeated = kRead};
}

Scenario refusedProperties(const std::string& variant, std::function<Situation()> situation) {
  return {.name = "getXQ4PathAndVersion, " + variant,
          .symbols = {"getXQ4PathAndVersion"},
          .run =
              [=] {
                setHome(path(""));
                const Selected selected(situation());
                return pathAndVersion();
              },
          .ends = {{kNothing, "null and nothing"}}};
}

void addFiles(std::vector<Scenario>& all) {
  const std::string both = std::string(kPathLine) + kVersionLine;
  all.push_back(properties("migration", both, found(kBoth, "\"9.1.0.2\"")));
  all.push_back({.name = "getXQ4PathAndVersion, instance",
                 .symbols = {"getXQ4PathAndVersion"},
                 .prepare = [=] { writeProperties("vraslapd-inst1", "ldapdb.properties", both); },
                 .run =
                     [] {
                       const Selected selected({.local = 1, .name = "inst1", .location = path("")});
                       return pathAndVersion();
                     },
                 .ends = found(kBoth, "\"9.1.0.2\""),
                 .repeated = kRead});
  Scenario installation = {.name = "getXQ4PathAndVersion, installation",
                           .symbols = {"getXQ4PathAndVersion"},
                           .prepare = [=] { writeProperties("", "ldapdb.properties", both); },
                           .run =
                               [] {
                                 setHome(path(""));
                                 const Selected selected({.local = 2});
                                 return pathAndVersion();
                               },
                           .ends = found(kBoth, "\"9.1.0.2\""),
                           .repeated = kRead};
  // The usual root has no file.
  installation.ends.push_back({kReading, "null and nothing"});
  all.push_back(installation);
  all.push_back({.name = "getXQ4PathAndVersion, without a version",
                 .symbols = {"getXQ4PathAndVersion"},
                 .prepare = [=] { writeProperties("", "xq4info", kPathLine); },
                 .run =
                     [] {
                       const Selected selected({.is_migration = true, .backup = path("")});
                       return freed(getXQ4PathAndVersion(nullptr));
                     },
                 .ends = {{kNothing, "\"/opt/xq4/V9.1\""},
                          {kPrinting | kStatus | kOpen, "null"},
                          {kOpen | kRead, "null", "", {1, 0}}},
                 .repeated = kRead});

  all.push_back(
      refusedProperties("no migration directory", [] { return Situation{.is_migration = true}; }));
  all.push_back(refusedProperties("no instance name",
                                  [] { return Situation{.local = 1, .location = path("")}; }));
  all.push_back(refusedProperties("no instance location",
                                  [] { return Situation{.local = 1, .name = "inst1"}; }));
  all.push_back(refusedProperties("missing file", [] { return Situation{}; }));
}

void addContents(std::vector<Scenario>& all) {
  const std::string long_line(1024, 'x');
  const std::string filler = "# " + std::string(600, 'x') + "\n";
  all.push_back(
      properties("other lines between", filler + kVersionLine + filler + kPathLine + filler, [] {
        std::vector<End> ends = found(kBoth, "\"9.1.0.2\"");
        // a read error after the version
        ends.push_back({kRead, "null and \"9.1.0.2\"", "", {1, 0}});
        return ends;
      }()));
  all.push_back(properties("path alone", kPathLine, notFound("null and nothing")));
  std::vector<End> version_alone = notFound("null and \"9.1.0.2\"");
  version_alone.push_back({kMemory, "null and null", "", {1, 0}});
  version_alone.push_back({kMemory, "null and null"});
  all.push_back(properties("version alone", kVersionLine, version_alone));
  all.push_back(properties("invalid version",
                           std::string(kPathLine) + "currentXQ4Version=9.1.0.2\r\n",
                           notFound("null and null")));
  all.push_back(properties("empty file", "", notFound("null and nothing")));
  all.push_back(properties("overlong line",
                           std::string(kPathLine) + long_line + "\n" + kVersionLine,
                           notFound("null and nothing")));
}

void addVersions(std::vector<Scenario>& all) {
  const std::vector<std::pair<const char*, bool>> versions = {
      {"9", true},   {"9.1.0.2", true}, {"9.1.0.2.3", false}, {"9..1", false},
      {".9", false}, {"9.1a", false},   {"", false},          {nullptr, false}};
  for (const auto& [version, is_valid] : versions) {
    all.push_back({.name = std::string("isVersionValid, ") +
                           (version == nullptr ? "null" : "\"" + std::string(version) + "\""),
                   .symbols = {"isVersionValid"},
                   .run = [version = version] { return shown(isVersionValid(version)); },
                   .ends = {{kNothing, shown(is_valid)}}});
  }
}

// ---- Time ----

std::string formatted(time_t time, const char* format) {
  tm fields = {};
  gmtime_r(&time, &fields);
  std::ostringstream text;
  text << std::put_time(&fields, format);
  return text.str();
}

// "now" for a stamp of one of these seconds that is complete.
std::string shownStamp(char* stamp, bool is_readable, time_t first, time_t last) {
  if (stamp == nullptr) return freed(stamp);
  const std::string text = stamp;
  for (time_t second = first; second <= last; ++second) {
    if (!is_readable && text == formatted(second, "%Yy%my%dy%Hy%My%S")) {
      free(stamp);
      return "now";
    }
    const std::string beginning = formatted(second, "%Y-%m-%d-%H:%M:%S.");
    if (is_readable && text.starts_with(beginning) && text.size() == beginning.size() + 9 &&
        text.find_first_not_of("0123456789", beginning.size()) == beginning.size() + 3 &&
        text.ends_with("+00:00")) {
      free(stamp);
      return "now";
    }
  }
  return freed(stamp);
}

Scenario stamp(const std::string& variant, int flag, std::vector<End> ends) {
  return {.name = "getCurrentTimeStamp, " + variant,
          .symbols = {"getCurrentTimeStamp"},
          .run =
              [=] {
                setenv("TZ", "UTC0", 1);
                tzset();
                const time_t first = time(nullptr);  // may lag behind the call by a tick
                char* const result = getCurrentTimeStamp(flag);
                return shownStamp(result, (flag & 0xFF) != 0, first, time(nullptr) + 1);
              },
          .ends = std::move(ends)};
}

// What a clock that cannot be read makes of elapsed time, too.
std::string shownElapsed(long milliseconds) {
  constexpr long kDay = 86'400'000;
  const long now = static_cast<long>(time(nullptr)) * 1000;
  if (milliseconds >= 0 && milliseconds < kDay) return "elapsed";
  if (labs(milliseconds - now) < kDay) return "since 1970";
  if (labs(milliseconds + now) < kDay) return "until 1970";
  return std::to_string(milliseconds);
}

void addTime(std::vector<Scenario>& all) {
  const std::vector<std::pair<std::string, int>> flags = {
      {"readable", 1}, {"compact", 0}, {"compact, low byte", 256}};
  for (const auto& [variant, flag] : flags) {
    const bool is_readable = flag == 1;
    std::vector<End> ends = {{kNothing, "now"}, {kMemory | kClock, "null"}};
    if (is_readable) ends.push_back({kPrint, "null"});
    all.push_back(stamp(variant, flag, ends));
  }
  static const std::set<std::string> without_clock = {
      "since 1970, since 1970", "until 1970, elapsed", "until 1970, until 1970",
      "elapsed, until 1970"};
  all.push_back(
      {.name = "current_time_in_milliseconds, twice",
       .symbols = {"current_time_in_milliseconds"},
       .run =
           [] {
             const std::string first = shownElapsed(current_time_in_milliseconds());
             return first + ", " + shownElapsed(current_time_in_milliseconds());
           },
       .ends = {{kNothing, "elapsed, elapsed"}, {kClock, Expected([](const std::string& result) {
                                                   return without_clock.contains(result);
                                                 })}},
       .repeatable = false});
}

}  // namespace

std::vector<Scenario> environmentScenarios() {
  std::vector<Scenario> all;
  addVariables(all);
  addLayout(all);
  addComponent(all);
  addFiles(all);
  addContents(all);
  addVersions(all);
  addTime(all);
  return all;
}

}  // namespace scenarios
