// The paths of the product's installation, and of the database that an instance uses.

#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "cancellation.h"
#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "resumed_stream.h"
#include "separators.h"
#include "text.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::OwnedString;
using osutils::TraceScope;

const char* g_dirInstName = nullptr;
const char* g_dirInstLocation = nullptr;
const char* g_migBackDir = nullptr;
unsigned char g_isCallerVraImigr = 0;
unsigned char g_loadLocalXQ4Path = 0;
const char* rdbm_lib = "/lib64/libvradbutils.so";

namespace {

constexpr const char kSeparator[] = "/";
constexpr const char kDefaultInstallPath[] = "/opt/orx/ldap/V6.1";
constexpr const char kVarBasePath[] = "/var/vraldap/V6.1";
constexpr const char kConfigurationDirectory[] = "etc";
constexpr const char kPropertiesFile[] = "ldapdb.properties";
constexpr const char kMigrationFile[] = "xq4info";
constexpr const char kPathKey[] = "currentXQ4InstallPath";
constexpr const char kVersionKey[] = "currentXQ4Version";

// Returns what follows the first "=" of the line, or null unless the key stands before that "=".
// sic: the key may be anywhere before it, even in a comment.
const char* findValue(const char* line, const char* key) {
  const char* const at = strstr(line, key);
  const char* const equals = strchr(line, '=');
  return at != nullptr && equals != nullptr && equals > at ? equals + 1 : nullptr;
}

// Reads the lines of a properties file, without their newlines. Stops at a read error and at a line
// of more than 1023 characters: part of a line may be a wrong path. Small, because it is on the
// caller's stack.
class PropertiesReader {
 public:
  explicit PropertiesReader(FILE* stream) : stream_(stream) {}

  bool next() {
    line_ = next_;
    for (;;) {
      void* const newline = memchr(block_ + line_, '\n', end_ - line_);
      if (newline != nullptr) {
        next_ = static_cast<size_t>(static_cast<char*>(newline) - block_) + 1;
        block_[next_ - 1] = '\0';
        return true;
      }
      if (at_end_) break;
      readOn();
    }
    next_ = end_;
    if (line_ == end_ || end_ == sizeof block_ || ferror(stream_) != 0) return false;
    block_[end_] = '\0';
    return true;
  }
  const char* line() const { return block_ + line_; }

 private:
  void readOn() {
    end_ -= line_;
    memmove(block_, block_ + line_, end_);
    line_ = 0;
    const size_t room = sizeof block_ - end_;
    const size_t got = osutils::readStream(stream_, block_ + end_, room);
    end_ += got;
    at_end_ = got < room || room == 0;  // without room the line is too long
  }

  FILE* stream_;
  size_t line_ = 0;  // where the line begins in the block
  size_t next_ = 0;  // where the next one begins
  size_t end_ = 0;   // where the text in the block ends
  bool at_end_ = false;
  char block_[1024];
};

}  // namespace

// ---- Installation layout ----

TRACED char* getVRAInstallPath(void) {
  TraceScope<traced::getVRAInstallPath> trace;

  char* path = getEnvVar("VRA_LDAP_HOME");
  if (path == nullptr) path = strdup(kDefaultInstallPath);
  if (path == nullptr) return nullptr;
  osutils::stripTrailingSeparator(path);
  return path;
}

TRACED char* getVRAVarBasePath(void) {
  TraceScope<traced::getVRAVarBasePath> trace;
  return strdup(kVarBasePath);
}

TRACED char* getVRABaseSchemaDirPath(const char* version) {
  TraceScope<traced::getVRABaseSchemaDirPath> trace;

  if (version == nullptr) {
    DEBUG_MESSAGE(trace, "getVRABaseSchemaDirPath: passed a NULL pointer.\n");
    return nullptr;
  }
  // sic: leaked deliberately, unlike in the functions below.
  const char* const root = getVRAInstallPath();
  if (root == nullptr) return nullptr;
  char* path = nullptr;
  if (vra_asprintf(&path, "%s%s%s%s%s%s", root, kSeparator, kConfigurationDirectory, kSeparator,
                   "SchemaV", version) == -1) {
    // sic: names getVRAVarBasePath.
    DEBUG_MESSAGE(trace, "getVRAVarBasePath: vra_asprintf failed\n");
    return nullptr;
  }
  return path;
}

TRACED char* getAdminLogsPath(int fileType) {
  TraceScope<traced::getAdminLogsPath> trace;

  const char* file = nullptr;
  switch (fileType) {
    case ADMIN_LOG_XQ4:
      file = "vraadmxq4.log";
      break;
    case ADMIN_LOG_XQ4_CMDS:
      file = "vraadmxq4cmds.log";
      break;
    case ADMIN_LOG_ADM:
      file = "vraadm.log";
      break;
    default:
      DEBUG_MESSAGE(trace, "getAdminLogsPath:: Invalid file Type specified.\n");
      return nullptr;
  }
  const OwnedString base(getVRAVarBasePath());
  if (!base) {
    DEBUG_MESSAGE(trace, "getAdminLogsPath: Unable to get var bast path.\n");  // sic: "bast"
    return nullptr;
  }
  char* path = nullptr;
  if (vra_asprintf(&path, "%s%s%s", base.get(), kSeparator, file) == -1) {
    DEBUG_MESSAGE(trace, "getAdminLogsPath: vra_asprintf failed\n");
    return nullptr;
  }
  return path;
}

TRACED bool isRDBMComponentInstalled(void) {
  TraceScope<traced::isRDBMComponentInstalled> trace;

  const OwnedString root(getVRAInstallPath());
  if (!root) {
    DEBUG_MESSAGE(trace, "isRDBMComponentInstalled: Unable to locate VRA install directory.\n");
    return false;
  }
  char* file = nullptr;
  const int rc = vra_asprintf(&file, "%s%s", root.get(), rdbm_lib);
  const OwnedString path(rc == -1 ? nullptr : file);
  // sic: written before `rc` is checked.
  DEBUG_MESSAGE(trace, "isRDBMComponentInstalled: searching for file '%s'.\n", path.get());
  return rc != -1 && doesFileExist(path.get());
}

TRACED char* getVRAInstallLibPath(void) {
  TraceScope<traced::getVRAInstallLibPath> trace;

  const OwnedString root(getVRAInstallPath());
  if (!root) {
    DEBUG_MESSAGE(trace, "getVRAInstallLibPath: Unable to find install path.\n");
    return nullptr;
  }
  char* path = nullptr;
  if (vra_asprintf(&path, "%s%s%s", root.get(), kSeparator, "lib64") == -1) {
    DEBUG_MESSAGE(trace, "getVRAInstallLibPath: vra_asprintf failed.\n");
    return nullptr;
  }
  return path;
}

TRACED char* getVRAInstallSbinPath(void) {
  TraceScope<traced::getVRAInstallSbinPath> trace;

  const OwnedString root(getVRAInstallPath());
  if (!root) {
    DEBUG_MESSAGE(trace, "getVRAInstallSbinPath: Unable to find install path.\n");
    return nullptr;
  }
  char* path = nullptr;
  if (vra_asprintf(&path, "%s%s%s", root.get(), kSeparator, "sbin") == -1) {
    DEBUG_MESSAGE(trace, "getVRAInstallSbinPath: vra_asprintf failed.\n");
    return nullptr;
  }
  return path;
}

TRACED char* getVRAVrarunFilePath(void) {
  TraceScope<traced::getVRAVrarunFilePath> trace;

  const OwnedString sbin(getVRAInstallSbinPath());
  if (!sbin) {
    DEBUG_MESSAGE(trace, "getVRAVrarunFilePath: Unable to find sbin path.\n");
    return nullptr;
  }
  char* path = nullptr;
  if (vra_asprintf(&path, "%s%s%s%s%s", sbin.get(), kSeparator, "64", kSeparator, "vrarun") == -1) {
    DEBUG_MESSAGE(trace, "getVRAVrarunFilePath: vra_asprintf failed.\n");
    return nullptr;
  }
  return path;
}

// ---- Database discovery ----

namespace {

// Returns the path of the file that the g_ variables select, or null with the reason in a message.
template <typename Trace>
OwnedString propertiesPath(Trace& trace) {
  char* name = nullptr;
  int rc = 0;
  if (g_isCallerVraImigr != 0) {
    if (g_migBackDir == nullptr) {
      ERROR_MESSAGE(trace, "Error - getXQ4PathAndVersion: g_migBackDir is NULL\n");
      return nullptr;
    }
    rc = vra_asprintf(&name, "%s%s%s%s%s", g_migBackDir, kSeparator, kConfigurationDirectory,
                      kSeparator, kMigrationFile);
    if (rc == -1) {
      // sic: names a function that does not exist.
      ERROR_MESSAGE(trace, "Error - getXQ4PropertiesFile: vra_asprintf failed with rc=%d\n", rc);
      return nullptr;
    }
  } else {
    if (g_loadLocalXQ4Path == 1) {
      if (g_dirInstName == nullptr) {
        ERROR_MESSAGE(trace, "getXQ4PathAndVersion: instance name not available\n");
        return nullptr;
      }
      if (g_dirInstLocation == nullptr) {
        ERROR_MESSAGE(trace, "getXQ4PathAndVersion: instance location not available\n");
        return nullptr;
      }
      rc = vra_asprintf(&name, "%s%s%s%s%s%s%s%s", g_dirInstLocation, kSeparator, "vraslapd-",
                        g_dirInstName, kSeparator, kConfigurationDirectory, kSeparator,
                        kPropertiesFile);
    } else {
      const OwnedString root(getVRAInstallPath());
      if (!root) {
        ERROR_MESSAGE(trace, "getXQ4PathAndVersion: getVRAInstallPath returned NULL\n");
        return nullptr;
      }
      rc = vra_asprintf(&name, "%s%s%s%s%s", root.get(), kSeparator, kConfigurationDirectory,
                        kSeparator, kPropertiesFile);
    }
    if (rc == -1) {
      ERROR_MESSAGE(trace, "Error - getXQ4PathAndVersion: vra_asprintf failed. return code= %d \n",
                    rc);
      return nullptr;
    }
  }
  if (name == nullptr) ERROR_MESSAGE(trace, "getXQ4PathAndVersion: path2 is NULL\n");
  return OwnedString(name);
}

void trimPath(char* path) {
  size_t length = strlen(path);
  while (length > 0 && strchr("\t\n\r ", path[length - 1]) != nullptr) --length;
  path[length] = '\0';
  osutils::stripTrailingSeparator(path);
}

}  // namespace

TRACED char* getXQ4PathAndVersion(char** version) {
  TraceScope<traced::getXQ4PathAndVersion> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  const OwnedString file = propertiesPath(trace);
  if (!file) return nullptr;
  if (!doesFileExist(file.get()) || !canAccessFile(file.get())) {
    ERROR_MESSAGE(trace,
                  "getXQ4PathAndVersion: the file %s is either non-existent or is inaccessible\n",
                  file.get());
    return nullptr;
  }

  char path_value[1024] = "";
  bool path_found = false;
  bool version_found = version == nullptr;  // or not asked for
  const osutils::OwnedStream stream = osutils::openStream(file.get(), "re");
  if (stream) {
    // Reads to the end of the file, even after both keys.
    for (PropertiesReader reader(stream.get()); reader.next();) {
      const char* const line = reader.line();
      if (!path_found) {
        if (const char* const value = findValue(line, kPathKey)) {
          memcpy(path_value, value, strlen(value) + 1);
          path_found = true;
          continue;  // not searched for the version
        }
      }
      if (!version_found) {
        if (const char* const value = findValue(line, kVersionKey)) {
          *version = strdup(value);
          if (*version == nullptr) break;
          if (!isVersionValid(*version)) {
            (void)PrintMessageCmdLine(20, 1, 53, 1, 1, file.get());
            free(*version);
            *version = nullptr;
            break;
          }
          version_found = true;
        }
      }
    }
  }

  const OwnedString path(strdup(path_value));
  if (path) trimPath(path.get());
  char* const result = getShortname(path.get());
  if (result == nullptr) ERROR_MESSAGE(trace, "getXQ4PathAndVersion: path4 is NULL\n");
  // sic: leaked deliberately when it is not returned.
  return path_found && version_found ? result : nullptr;
}

TRACED bool isVersionValid(const char* version) {
  TraceScope<traced::isVersionValid> trace;

  if (version == nullptr) return trace.result(false);
  DEBUG_MESSAGE(trace, "isVersionValid: version received is %s\n", version);
  const size_t length = strlen(version);
  if (length == 0 || !osutils::isDigit(version[0]) || !osutils::isDigit(version[length - 1])) {
    return trace.result(false);
  }
  int dots = 0;
  for (size_t i = 1; i < length && dots <= 3; ++i) {
    if (version[i] == '.') {
      if (version[i - 1] == '.' || version[i + 1] == '.') return trace.result(false);
      ++dots;
    } else if (!osutils::isDigit(version[i])) {
      return trace.result(false);
    }
  }
  return trace.result(dots <= 3);
}
