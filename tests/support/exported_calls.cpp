#include "exported_calls.h"

#include <arpa/inet.h>
#include <ldap_clientosutils.h>
#include <ldtr.h>
#include <net/if.h>
#include <netinet/in.h>
#include <osutils.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <list>
#include <memory>

#include "world.h"

namespace {

using VRAOSUtils::EtcInittab;
using VRAOSUtils::EtcServices;

// The arguments: strings that the library may write to, created before any call.
struct Paths {
  std::string file, copy, fresh, missing, link, target, removable, directory, fresh_directory,
      empty_directory, tree, services, services_backup, inittab, inittab_backup, launcher;
};

Paths pathsIn(const std::string& in) {
  return {in + "/file",       in + "/copy",    in + "/fresh",     in + "/missing",
          in + "/link",       in + "/target",  in + "/removable", in,
          in + "/fresh_dir",  in + "/empty",   in + "/tree",      in + "/services",
          in + "/services.b", in + "/inittab", in + "/inittab.b", in + "/launcher"};
}

bool released(char* text) {
  free(text);
  return text != nullptr;
}

bool isReleased(char* text, const char* expected) {
  const bool equal = text != nullptr && strcmp(text, expected) == 0;
  free(text);
  return equal;
}

bool released(char** list) {
  if (list == nullptr) return false;
  for (char** entry = list; *entry != nullptr; ++entry) free(*entry);
  free(static_cast<void*>(list));
  return true;
}

// There is a list only after a success: this host's name may not be resolvable.
bool listed(int code, char** list) { return released(list) == (code == 0); }

int printSafely(char* text, int size, const char* format, ...)
    __attribute__((format(printf, 3, 4)));
int printSafely(char* text, int size, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const int code = safer_vsprintf(size, text, format, arguments);
  va_end(arguments);
  return code;
}

void writeRecord(const char* format, ...) __attribute__((format(printf, 1, 2)));
void writeRecord(const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  ldtr_write(LDTR_TYPE_DEBUG, 1, nullptr, format, arguments);
  va_end(arguments);
}

struct OwnServices : EtcServices {};
struct OwnInittab : EtcInittab {};
struct OwnLock : AutoLock {
  using AutoLock::AutoLock;
};
struct OwnFree : AutoFree<char> {
  using AutoFree<char>::AutoFree;
};

ExportedCall call(const char* symbol, std::function<bool()> body,
                  Enters enters = Enters::kNothing) {
  return {{symbol}, enters, std::move(body)};
}

Meanwhile meanwhile(const std::string& symbol) {
  if (symbol == "putEnvVar") return Meanwhile::kNoCall;
  if (!symbol.starts_with("_ZN10VRAOSUtils")) return Meanwhile::kAnything;
  for (const char* edit :
       {"addService", "deleteService", "addInittabEntry", "deleteInittabEntry"}) {
    if (symbol.find(edit) != std::string::npos) return Meanwhile::kNoUseOfEditedFiles;
  }
  return Meanwhile::kNoEdit;
}

bool needsDirectoryFilledAgain(const std::string& symbol) {
  for (const char* function : {"clearFile", "createDirectory", "createSymLink", "deleteDirectory",
                               "deleteDirForcefully", "deleteFile", "removeSymLink"}) {
    if (symbol == function) return true;
  }
  return false;
}

}  // namespace

void fillEditedFiles(const std::string& directory) {
  const Paths paths = pathsIn(directory);
  for (const std::string& file : {paths.services, paths.services_backup}) {
    writeFile(file, "# comment\npost 25/tcp\nweb 80/tcp\n");
  }
  for (const std::string& file : {paths.inittab, paths.inittab_backup}) {
    writeFile(file, "# comment\nld0:2345:once:/bin/true\nx:2:respawn:/bin/false\n");
  }
}

void fillCalls(const std::string& directory) {
  const Paths paths = pathsIn(directory);
  for (const auto& each : std::filesystem::directory_iterator(directory)) {
    std::filesystem::remove_all(each);
  }
  for (const std::string& file : {paths.file, paths.copy, paths.removable}) {
    writeFile(file, "some text\n");
  }
  for (const std::string& made : {paths.empty_directory, paths.tree, paths.tree + "/below",
                                  paths.launcher, directory + "/etc", directory + "/lib64"}) {
    std::filesystem::create_directory(made);
  }
  fillEditedFiles(directory);
  writeFile(directory + "/etc/ldapdb.properties",
            "currentXQ4InstallPath=/opt/xq4/\ncurrentXQ4Version=9.1\n");
  writeFile(directory + "/lib64/libvradbutils.so", "");
  // A program that is written here could not be started while a process that another thread has just
  // forked still holds it open (ETXTBSY).
  std::filesystem::create_symlink("/bin/true", paths.launcher + "/vrarun");
  std::filesystem::create_symlink("file", paths.target);
}

void prepareCalls(const std::string& directory) {
  fillCalls(directory);
  useCalls(directory);
}

void useCalls(const std::string& directory) {
  static Paths edited;
  edited = pathsIn(directory);
  EtcServices::ETC_SERVICES_FILE = edited.services.c_str();
  EtcServices::ETC_SERVICES_FILE_BACKUP = edited.services_backup.c_str();
  EtcInittab::ETC_INITTAB_FILE = edited.inittab.c_str();
  EtcInittab::ETC_INITTAB_FILE_BACKUP = edited.inittab_backup.c_str();
  (void)setenv("VRA_LDAP_HOME", directory.c_str(), 1);
}

std::vector<ExportedCall> exportedCalls(const std::string& directory) {
  static std::list<Paths> every_paths;  // the bodies refer to them
  Paths& p = every_paths.emplace_back(pathsIn(directory));
  char* const none = nullptr;
  std::vector<ExportedCall> calls = {
      // environment
      call("getEnvVar", [] { return released(getEnvVar("PATH")) && !getEnvVar(nullptr); }),
      call("putEnvVar",
           [none] {
             static char name[] = "OSUTILS_TEST";
             return putEnvVar(name, "value") == 0 &&
                    putEnvVar(none, "value") == OSUTILS_PARAM_ERROR;
           }),
      // files
      call("doesFileExist",
           [&p] { return doesFileExist(p.file.c_str()) && !doesFileExist(p.missing.c_str()); }),
      call("canAccessFile", [&p] { return canAccessFile(p.missing.c_str()); }),
      call("isDirectory",
           [&p] { return isDirectory(p.directory.c_str()) && !isDirectory(p.missing.c_str()); }),
      call("isFile", [&p] { return isFile(p.file.data()) && !isFile(p.missing.data()); }),
      call("canWriteToFile",
           [&p] { return canWriteToFile(p.file.data()) && !canWriteToFile(p.directory.data()); }),
      call("checkFilePerms",
           [&p] {
             return checkFilePerms(p.file.c_str()) == OSUTILS_SUCCESS &&
                    checkFilePerms(p.directory.c_str()) == OSUTILS_CONSTRAINT_VIOLATION &&
                    checkFilePerms(p.missing.c_str()) == OSUTILS_NO_SUCH_OBJECT;
           }),
      call("copyFile",
           [&p] {
             return copyFile(p.file.c_str(), p.copy.data(), nullptr, nullptr, 0600) &&
                    !copyFile(p.file.c_str(), nullptr, nullptr, nullptr, 0600);
           }),
      call(
          "createFile", [&p] { return createFile(p.fresh.data(), nullptr, nullptr, 0600); },
          Enters::kAccounts),
      call("deleteFile",
           [&p] { return deleteFile(p.removable.data()) && !deleteFile(p.missing.data()); }),
      call("clearFile",
           [&p] { return clearFile(p.file.c_str()) && !clearFile("/proc/self/no such file"); }),
      call("readFile",
           [&p] {
             char* text = nullptr;
             const bool read = readFile(p.file.c_str(), &text);
             free(text);
             return read && !readFile(p.missing.c_str(), &text);
           }),
      call("getFileNameFromPath",
           [] {
             return isReleased(getFileNameFromPath("/a/b"), "b") && !getFileNameFromPath(nullptr);
           }),
      call(
          "getFileOwnersAndPermissions",
          [] {
            char* owner = nullptr;
            char* group = nullptr;
            unsigned int mode = 0;
            const bool got = getFileOwnersAndPermissions("/", &owner, &group, &mode);
            free(owner);
            free(group);
            return got;
          },
          Enters::kAccounts),
      call(
          "setFileOwnersAndPermissions",
          [none, &p] {
            return setFileOwnersAndPermissions(FILE_DESC_USE_PATH, p.file.data(), none, none, 0600);
          },
          Enters::kAccounts),
      // accounts
      call(
          "vra_getpwnam_uid", [] { return vra_getpwnam_uid("root") == 0; }, Enters::kAccounts),
      call(
          "vra_getgrnam_gid", [] { return vra_getgrnam_gid("root") == 0; }, Enters::kAccounts),
      call(
          "vra_getpwnam_homedir", [] { return released(vra_getpwnam_homedir("root")); },
          Enters::kAccounts),
      call(
          "vra_getgrnam_mem", [] { return released(vra_getgrnam_mem("root")); }, Enters::kAccounts),
      call(
          "vra_get_uid", [] { return vra_get_uid("root") == 0; }, Enters::kAccounts),
      call(
          "vra_get_usr_gid", [] { return vra_get_usr_gid("root") == 0; }, Enters::kAccounts),
      call(
          "vra_get_usr_name", [] { return isReleased(vra_get_usr_name("root"), "root"); },
          Enters::kAccounts),
      call(
          "vra_getgrgid_gid", [] { return vra_getgrgid_gid(0) == 0; }, Enters::kAccounts),
      call(
          "vra_getgrgid_name", [] { return released(vra_getgrgid_name(0)); }, Enters::kAccounts),
      call(
          "getUsersPrimaryGroup", [] { return released(getUsersPrimaryGroup("root")); },
          Enters::kAccounts),
      call(
          "isMemberOfGroup",
          [] { return isMemberOfGroup("root", "root") && !isMemberOfGroup(nullptr, nullptr); },
          Enters::kAccounts),
      call(
          "isValidUser",
          [] {
            return isValidUser("root", nullptr) == OSUTILS_SUCCESS &&
                   isValidUser("no such user", nullptr) == OSUTILS_NO_SUCH_OBJECT;
          },
          Enters::kShell),
      call(
          "doesUserExist", [] { return doesUserExist("root"); }, Enters::kAccounts),
      call(
          "getUserHomeDir",
          [] { return released(getUserHomeDir("root")) && !getUserHomeDir("no such user"); },
          Enters::kAccounts),
      call(
          "doesGroupExist", [] { return doesGroupExist("root"); }, Enters::kAccounts),
      // installation layout and database
      call("getVRAInstallPath",
           [] { return isReleased(getVRAInstallPath(), getenv("VRA_LDAP_HOME")); }),
      call("getVRAVarBasePath", [] { return released(getVRAVarBasePath()); }),
      call("getVRABaseSchemaDirPath", [] { return released(getVRABaseSchemaDirPath("3")); }),
      call("getAdminLogsPath",
           [] { return released(getAdminLogsPath(ADMIN_LOG_ADM)) && !getAdminLogsPath(-1); }),
      call("isRDBMComponentInstalled", [] { return isRDBMComponentInstalled(); }),
      call("getVRAInstallLibPath", [] { return released(getVRAInstallLibPath()); }),
      call("getVRAInstallSbinPath", [] { return released(getVRAInstallSbinPath()); }),
      call("getVRAVrarunFilePath", [] { return released(getVRAVrarunFilePath()); }),
      call("getXQ4PathAndVersion",
           [] {
             char* version = nullptr;
             const bool found = isReleased(getXQ4PathAndVersion(&version), "/opt/xq4");
             return isReleased(version, "9.1") && found;
           }),
      call("isVersionValid", [] { return isVersionValid("9.1") && !isVersionValid("9."); }),
      // directories and links
      call("getTempDir", [] { return isReleased(getTempDir(), "/tmp"); }),
      call("getSystemDrive", [] { return isReleased(getSystemDrive(), "/"); }),
      call("getLocalDrives", [] { return getLocalDrives() == 0; }),
      call("getShortname", [] { return isReleased(getShortname("name"), "name"); }),
      call("getCurrentWorkingDirectory", [] { return released(getCurrentWorkingDirectory()); }),
      call(
          "createDirectory",
          [&p] {
            return createDirectory(p.fresh_directory.data(), nullptr, nullptr, 0700) &&
                   !createDirectory(nullptr, nullptr, nullptr, 0700);
          },
          Enters::kAccounts),
      call("deleteDirectory",
           [&p] {
             return deleteDirectory(p.empty_directory.c_str()) && !deleteDirectory(p.tree.c_str());
           }),
      call(
          "deleteDirForcefully", [&p] { return deleteDirForcefully(p.tree.data()); },
          Enters::kShell),
      call("createSymLink",
           [&p] {
             return createSymLink("file", p.link.c_str()) == 0 &&
                    createSymLink("file", p.file.c_str()) == -1;
           }),
      call("removeSymLink",
           [&p] {
             return removeSymLink(p.target.c_str()) == 0 && removeSymLink(p.target.c_str()) == -1;
           }),
      call("isEnoughDriveSpace", [&p] { return isEnoughDriveSpace(0, p.directory.data()); }),
      call("trimLastDirectory",
           [] {
             char path[] = "/usr/lib";
             char* text = path;
             return trimLastDirectory(&text) == 0 && trimLastDirectory(nullptr) == 1;
           }),
      // time
      call("getCurrentTimeStamp",
           [] { return released(getCurrentTimeStamp(1)) && released(getCurrentTimeStamp(0)); }),
      call("current_time_in_milliseconds", [] { return current_time_in_milliseconds() >= 0; }),
      // screening
      call("checkForMetaChars",
           [&p] { return checkForMetaChars(p.file.data() + p.file.size()) == 0; }),
      call("checkOptionsForMetaChars",
           [&p] {
             char* arguments[] = {p.file.data(), p.copy.data(), nullptr};
             return !checkOptionsForMetaChars(2, arguments);
           }),
      call("isValidName",
           [] {
             char good[] = "inst1";
             char bad[] = "sysinst";
             return isValidName(good) && !isValidName(bad);
           }),
      // processes and platform
      call(
          "startProcess",
          [&p] {
            return startProcess(p.launcher.c_str(), "-n") == 0 &&
                   startProcess(nullptr, "-n") == OSUTILS_PARAM_ERROR;
          },
          Enters::kShell),
      call("stopProcess",
           [] {
             return stopProcess("2147483647") == -1 && stopProcess(nullptr) == OSUTILS_PARAM_ERROR;
           }),
      call(
          "isProcessStarted", [] { return !isProcessStarted("2147483647", "nothing"); },
          Enters::kShell),
      call("getOSname", [] { return getOSname() != nullptr; }),
      call(
          "_Z6isNPTLv", [] { return isNPTL(); }, Enters::kShell),
      // shared libraries
      {{"loadSharedLib", "unloadSharedLib", "getSymAddress"},
       Enters::kNothing,
       [&p] {
         SharedLibHandle* const library = loadSharedLib("libanl.so.1", 0);
         const bool found = getSymAddress(library, "gai_cancel") != nullptr;
         return unloadSharedLib(library) == OSUTILS_SUCCESS && found &&
                loadSharedLib(p.file.c_str(), 0) == nullptr;
       }},
      // addresses
      call(
          "getAllIPAddresses",
          [] {
            char** list = nullptr;
            int count = 0;
            const int code = getAllIPAddresses(&list, &count);
            return listed(code, list);
          },
          Enters::kResolver),
      call(
          "getLocalHostIPAddress",
          [] {
            char** list = nullptr;
            int count = 0;
            const int code = getLocalHostIPAddress(&list, &count);
            return listed(code, list);
          },
          Enters::kResolver),
      call("getAllIPAddresses_Linux",
           [] {
             char** list = nullptr;
             int count = 0;
             ifconf scratch;
             const int code = getAllIPAddresses_Linux(&list, &count, &scratch);
             return listed(code, list);
           }),
      call("getAllIPAddresses_TVX", [] { return getAllIPAddresses_TVX() == 0; }),
      call(
          "isValidIPAddressOnSystem",
          [] {
            char address[] = "203.0.113.77";
            return !isValidIPAddressOnSystem(address);
          },
          Enters::kResolver),
      call("isValidIPAddressInList",
           [none] {
             char address[] = "10.0.0.1";
             char* list[] = {address, nullptr};
             return isValidIPAddressInList(address, list, 1) &&
                    !isValidIPAddressInList(none, list, 1);
           }),
      call(
          "vra_getnameinfo",
          [] {
            sockaddr_in address = {};
            address.sin_family = AF_INET;
            address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
            char* host = nullptr;
            char* service = nullptr;
            const int rc = vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address),
                                           sizeof address, &host, &service);
            free(host);
            free(service);
            return rc == OSUTILS_SUCCESS;
          },
          Enters::kResolver),
      call(
          "vra_gethostbyname",
          [] {
            hostent* entry = nullptr;
            int size = 0;
            const int rc = vra_gethostbyname("localhost", &entry, &size);
            free(entry);
            return rc == OSUTILS_SUCCESS;
          },
          Enters::kResolver),
      call(
          "vra_gethostbyaddr",
          [] {
            const in_addr address = {htonl(INADDR_LOOPBACK)};
            hostent* entry = nullptr;
            int size = 0;
            const int rc = vra_gethostbyaddr(&address, sizeof address, AF_INET, &entry, &size);
            free(entry);
            return rc == OSUTILS_SUCCESS;
          },
          Enters::kResolver),
      {{"_Z15calcHostentSizeP7hostent", "_Z11copyHostentP7hostentS0_"},
       Enters::kNothing,
       [] {
         char name[] = "host";
         hostent entry = {};
         entry.h_name = name;
         char block[128];
         return calcHostentSize(&entry) == 32 + 5 + 16 &&
                copyHostent(&entry, reinterpret_cast<hostent*>(block)) == 0;
       }},
      // distinguished names
      call("formatDn",
           [] {
             char dn[] = "cn = a ; o = x";
             return isReleased(formatDn(dn), "CN=A,O=X");
           }),
      call("compareDns",
           [] {
             char a[] = "cn=a";
             char b[] = "CN = A";
             return compareDns(a, b);
           }),
      // the services file
      {{"_ZN10VRAOSUtils11EtcServicesC1Ev", "_ZN10VRAOSUtils11EtcServicesD0Ev",
        "_ZN10VRAOSUtils11EtcServicesD1Ev", "_ZN10VRAOSUtils11EtcServices15readEtcServicesEv",
        "_ZN10VRAOSUtils11EtcServices14getServicePortEPKc",
        "_ZN10VRAOSUtils11EtcServices15isPortAvaliableEi",
        "_ZN10VRAOSUtils11EtcServices16doesServiceExistEPKc",
        "_ZN10VRAOSUtils11EtcServices16getServicesEntryEPKc",
        "_ZN10VRAOSUtils11EtcServices17findAvaliablePortEi",
        "_ZN10VRAOSUtils11EtcServices19freeServicesEntriesEv"},
       Enters::kNothing,
       [] {
         EtcServices services;
         bool right = services.readEtcServices() == OSUTILS_SUCCESS &&
                      services.getServicePort("web") == 80 && !services.isPortAvaliable(80) &&
                      services.doesServiceExist("post") && !services.doesServiceExist(nullptr) &&
                      services.getServicesEntry("none") == nullptr &&
                      services.findAvaliablePort(80) == 81;
         services.freeServicesEntries();
         const std::unique_ptr<EtcServices> made(new EtcServices);
         return right && !services.doesServiceExist("post");
       }},
      {{"_ZN10VRAOSUtils11EtcServicesC2Ev", "_ZN10VRAOSUtils11EtcServicesD2Ev"},
       Enters::kNothing,
       [] {
         OwnServices services;
         return services.readEtcServices() == OSUTILS_SUCCESS;
       }},
      call("_ZN10VRAOSUtils11EtcServices10addServiceEPKci",
           [] {
             EtcServices services;
             return services.readEtcServices() == OSUTILS_SUCCESS &&
                    services.addService("mail", 110) == OSUTILS_SUCCESS &&
                    services.addService("mail", 111) == OSUTILS_ALREADY_EXISTS;
           }),
      call("_ZN10VRAOSUtils11EtcServices13deleteServiceEPKc",
           [] {
             EtcServices services;
             return services.readEtcServices() == OSUTILS_SUCCESS &&
                    services.deleteService("web") == OSUTILS_SUCCESS &&
                    services.deleteService(nullptr) == OSUTILS_PARAM_ERROR;
           }),
      // the inittab file
      {{"_ZN10VRAOSUtils10EtcInittabC1Ev", "_ZN10VRAOSUtils10EtcInittabD0Ev",
        "_ZN10VRAOSUtils10EtcInittabD1Ev", "_ZN10VRAOSUtils10EtcInittab11readInittabEv",
        "_ZN10VRAOSUtils10EtcInittab21doesInittabEntryExistEPKc",
        "_ZN10VRAOSUtils10EtcInittab19isCommandRegisteredEPKc",
        "_ZN10VRAOSUtils10EtcInittab15findAvaliableIDEv",
        "_ZN10VRAOSUtils10EtcInittab15getInittabEntryEPKc",
        "_ZN10VRAOSUtils10EtcInittab26getInittabEntryWithCommandEPKc",
        "_ZN10VRAOSUtils10EtcInittab25getEntryInitIDWithCommandEPKc",
        "_ZN10VRAOSUtils10EtcInittab18freeInittabEntriesEv"},
       Enters::kNothing,
       [] {
         EtcInittab inittab;
         const bool right =
             inittab.readInittab() == OSUTILS_SUCCESS && inittab.doesInittabEntryExist("x") &&
             inittab.isCommandRegistered("/bin/true") && released(inittab.findAvaliableID()) &&
             inittab.getInittabEntry(nullptr) == nullptr &&
             inittab.getInittabEntryWithCommand("false") != nullptr &&
             isReleased(inittab.getEntryInitIDWithCommand("false"), "x");
         inittab.freeInittabEntries();
         const std::unique_ptr<EtcInittab> made(new EtcInittab);
         return right;
       }},
      {{"_ZN10VRAOSUtils10EtcInittabC2Ev", "_ZN10VRAOSUtils10EtcInittabD2Ev"},
       Enters::kNothing,
       [] {
         OwnInittab inittab;
         return inittab.readInittab() == OSUTILS_SUCCESS;
       }},
      call("_ZN10VRAOSUtils10EtcInittab15addInittabEntryEPKcS2_S2_S2_",
           [] {
             EtcInittab inittab;
             return inittab.readInittab() == OSUTILS_SUCCESS &&
                    inittab.addInittabEntry("y", "2", "once", "/bin/date") == OSUTILS_SUCCESS &&
                    inittab.addInittabEntry("y", "2", "once", nullptr) == OSUTILS_PARAM_ERROR;
           }),
      call("_ZN10VRAOSUtils10EtcInittab18deleteInittabEntryEPKc",
           [] {
             EtcInittab inittab;
             return inittab.readInittab() == OSUTILS_SUCCESS &&
                    inittab.deleteInittabEntry("x") == OSUTILS_SUCCESS &&
                    inittab.deleteInittabEntry("x") == OSUTILS_NO_SUCH_OBJECT;
           }),
      // the trace frame
      {{"_Z10ldtr_writemmPKv", "_Z10ldtr_writemmPKvPKc*", "_Z17ldtr_exit_errcodemmmlPKv",
        "_ZN19ldtr_formater_local10new_deleteEPKvPKcz",
        "_ZN19ldtr_formater_local10new_deleteEmPKvPKcz", "_ZN19ldtr_formater_local5debugEmPKcz",
        "_ZN19ldtr_formater_localclEPKcz", "_ZN19ldtr_formater_localclEmPKcz",
        "_ZN19ldtr_formater_localclEv", "_ZN20ldtr_formater_global10new_deleteEmPKvPKcz",
        "_ZN20ldtr_formater_global5debugEmPKcz", "_ZN20ldtr_formater_globalclEmPKcz",
        "_ZN20ldtr_function_global12SetErrorCodeEl"},
       Enters::kNothing,
       [] {
         ldtr_write(ldtr_entry_type(33), 1, nullptr);
         writeRecord("%d %s\n", 17, "text");
         ldtr_exit_errcode(1, 33, LDTR_EVENT_CLASS_33, 17, nullptr);
         ldtr_formater_local local(1, LDTR_TYPE_DEBUG, nullptr);
         local();
         local("%s\n", "text");
         local(2UL, "%s\n", "text");
         local.new_delete(&local, "%s\n", "text");
         local.new_delete(2UL, &local, "%s\n", "text");
         local.debug(LDTR_LEVEL_ORDINARY, "%s\n", "text");
         ldtr_formater_global global(LDTR_TYPE_DEBUG);
         global(1UL, "%s\n", "text");
         global.new_delete(1UL, &global, "%s\n", "text");
         global.debug(LDTR_LEVEL_ERROR, "%s\n", "text");
         return ldtr_fun.SetErrorCode(0) == 0;
       }},
      call("_Z9ldtr_initv", [] { return ldtr_init() == 0; }),
      call("_Z14safer_vsprintfiPcPKc*",
           [] {
             char text[64];
             return printSafely(text, sizeof text, "%s %d", "text", 17) == 0;
           }),
      {{"_ZN8AutoFreeIcEC1EPcPFvPvE", "_ZN8AutoFreeIcED0Ev", "_ZN8AutoFreeIcED1Ev",
        "_ZNK8AutoFreeIcE3getEv"},
       Enters::kNothing,
       [] {
         const AutoFree<char> owner(strdup("text"), free);
         const std::unique_ptr<AutoFree<char>> made(new AutoFree<char>(nullptr, free));
         return owner.get() != nullptr;
       }},
      {{"_ZN8AutoFreeIcEC2EPcPFvPvE", "_ZN8AutoFreeIcED2Ev"},
       Enters::kNothing,
       [] {
         const OwnFree owner(strdup("text"), free);
         return owner.get() != nullptr;
       }},
      {{"_ZN8AutoLockC1EP15pthread_mutex_tb", "_ZN8AutoLockD0Ev", "_ZN8AutoLockD1Ev",
        "_ZN8AutoLock18ReadAndSetLockTypeEi"},
       Enters::kNothing,
       [] {
         pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
         const AutoLock lock(&mutex, true);
         const std::unique_ptr<AutoLock> made(new AutoLock(nullptr, true));
         return AutoLock::ReadAndSetLockType(1) == 1;
       }},
      {{"_ZN8AutoLockC2EP15pthread_mutex_tb", "_ZN8AutoLockD2Ev"},
       Enters::kNothing,
       [] {
         pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
         const OwnLock lock(&mutex, true);
         return true;
       }},
  };
  for (ExportedCall& each : calls) {
    each.meanwhile = meanwhile(each.symbols.front());
    each.once = needsDirectoryFilledAgain(each.symbols.front());
  }
  return calls;
}

std::vector<std::string> symbolsWithoutCall(const std::vector<ExportedCall>& calls) {
  const auto has = [&](const std::string& symbol) {
    for (const ExportedCall& call : calls) {
      for (const std::string& each : call.symbols) {
        const bool is_beginning = each.back() == '*';
        if (is_beginning ? symbol.starts_with(each.substr(0, each.size() - 1)) : symbol == each) {
          return true;
        }
      }
    }
    return false;
  };
  std::vector<std::string> missing;
  std::ifstream list(EXPORTED_SYMBOLS);
  for (std::string line; std::getline(list, line);) {
    const std::string kind = "function ";
    if (!line.starts_with(kind)) continue;
    const std::string symbol = line.substr(kind.size(), line.find(' ', kind.size()) - kind.size());
    if (!has(symbol)) missing.push_back(symbol);
  }
  return missing;
}
