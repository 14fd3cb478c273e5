// Directories, links and free space, and paths that are constant on this platform.

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "separators.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

constexpr size_t kWorkingDirectoryBytes = 8192;
constexpr long kBytesPerMiB = 0x100000;

}  // namespace

TRACED char* getTempDir(void) {
  TraceScope<traced::getTempDir> trace;

  char* const path = strdup("/tmp");
  if (path != nullptr) osutils::stripTrailingSeparator(path);
  return path;
}

TRACED char* getSystemDrive(void) {
  TraceScope<traced::getSystemDrive> trace;
  return strdup("/");
}

TRACED int getLocalDrives(void) {
  TraceScope<traced::getLocalDrives> trace;
  DEBUG_MESSAGE(trace, "getLocalDrives: function not implemented on UNIX platforms.\n");
  return trace.result(0);
}

TRACED char* getShortname(const char* name) {
  TraceScope<traced::getShortname> trace;

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "getShortname: passed a null pointer.\n");
    return nullptr;
  }
  return strdup(name);
}

TRACED char* getCurrentWorkingDirectory(void) {
  TraceScope<traced::getCurrentWorkingDirectory> trace;
  return getcwd(nullptr, kWorkingDirectoryBytes);
}

TRACED bool createDirectory(char* path, char* user, char* group, unsigned int mode) {
  TraceScope<traced::createDirectory> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "createDirectory: passed a null pointer.\n");
    return trace.result(false);
  }
  if (doesFileExist(path)) return trace.result(false);
  if (!canAccessFile(path)) return trace.result(false);
  const int rc = mkdir(path, 0777);
  if (rc != 0) {
    DEBUG_MESSAGE(trace, "createDirectory: mkdir() failed with rc='%d'", rc);
    return trace.result(false);
  }
  if (!setFileOwnersAndPermissions(FILE_DESC_USE_PATH, path, user, group, mode)) {
    DEBUG_MESSAGE(trace, "createDirectory: Cannot set the directory permissions\n");
    (void)deleteDirectory(path);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED bool deleteDirectory(const char* path) {
  TraceScope<traced::deleteDirectory> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "deleteDirectory: passed a null pointer.\n");
    return trace.result(false);
  }
  if (!doesFileExist(path) || !isDirectory(path)) return trace.result(false);
  const int rc = rmdir(path);
  if (rc != 0) {
    DEBUG_MESSAGE(trace, "deleteDirectory: rmdir() failed with rc='%d'", rc);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED bool deleteDirForcefully(char* path) {
  TraceScope<traced::deleteDirForcefully> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "deleteDirForcefully: passed a null pointer.\n");
    return trace.result(false);
  }
  // The path is not quoted in the command: only this check prevents shell injection.
  if (checkForMetaChars(path)) {
    DEBUG_MESSAGE(trace, "deleteDirForcefully: passed in a metacharacter.\n");
    return trace.result(false);
  }
  if (!doesFileExist(path) || !isDirectory(path)) return trace.result(false);

  char* text = nullptr;
  if (vra_asprintf(&text, "rm -rf %s", path) == -1) {
    // sic: continues with what is in `text`; with null, system() runs nothing.
    DEBUG_MESSAGE(trace, "deleteDirForcefully: vra_asprintf failed.\n");
  }
  const OwnedString command(text);
  DEBUG_MESSAGE(trace, "deleteDirForcefully: command = '%s'.\n", command.get());
  const int rc = system(command.get());
  if (rc != 0 || !command) {  // system(nullptr) returns 0 if there is no shell
    DEBUG_MESSAGE(trace, "deleteDirForcefully: Failed to delete dir with rc='%d'", rc);
    return trace.result(false);
  }
  return trace.result(true);
}

TRACED int createSymLink(const char* target, const char* link) {
  TraceScope<traced::createSymLink> trace;

  if (target == nullptr || link == nullptr) {
    DEBUG_MESSAGE(trace, "createSymLink: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (symlink(target, link) != 0) {
    // sic: names createDirectory, and errno is "rc".
    DEBUG_MESSAGE(trace, "createDirectory: symlink() failed with rc='%d'", errno);
    return trace.result(-1);
  }
  return trace.result(OSUTILS_SUCCESS);
}

TRACED int removeSymLink(const char* link) {
  TraceScope<traced::removeSymLink> trace;

  if (link == nullptr) {
    DEBUG_MESSAGE(trace, "removeSymLink: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (unlink(link) != 0) {
    DEBUG_MESSAGE(trace, "removeSymLink: unlink() failed with rc='%d'", errno);
    return trace.result(-1);
  }
  return trace.result(OSUTILS_SUCCESS);
}

TRACED bool isEnoughDriveSpace(long requiredMiB, char* path) {
  TraceScope<traced::isEnoughDriveSpace> trace;

  if (path == nullptr) {
    DEBUG_MESSAGE(trace, "isEnoughDriveSpace: passed a null pointer.\n");
    return trace.result(false);
  }
  char* text = nullptr;
  if (vra_asprintf(&text, "%s", path) == -1) {
    DEBUG_MESSAGE(trace, "isEnoughDriveSpace: vra_asprintf failed.\n");
    return trace.result(false);
  }
  const OwnedString copy(text);
  struct statfs space;
  if (statfs(copy.get(), &space) != 0) return trace.result(false);
  const unsigned long bytes = space.f_bavail * static_cast<unsigned long>(space.f_bsize);
  // sic: 8 EiB or more is negative as a long, so only a request of 0 or less succeeds.
  return trace.result(requiredMiB <= 0 || static_cast<long>(bytes) / kBytesPerMiB >= requiredMiB);
}

TRACED int trimLastDirectory(char** pathPtr) {
  TraceScope<traced::trimLastDirectory> trace;

  if (pathPtr == nullptr) {
    DEBUG_MESSAGE(trace, "trimLastDirectory: path is null.\n");
    return trace.result(1);
  }
  char* const path = *pathPtr;
  if (path == nullptr || path[0] == '\0') return trace.result(0);
  // sic: "/usr" becomes empty, not "/".
  char* const last = strrchr(path, '/');
  *(last != nullptr ? last : path) = '\0';
  return trace.result(0);
}
