// osutils.h for C++17 and later: new strings and lists as std::string and std::vector, result codes
// as std::error_code. Everything is inline: a program needs only this header and the library.
//
// Rules for this header; a function's own comment says only what differs.
//   names     a function of the name of one in osutils.h calls that one, once, and does nothing
//             else. That one's comment says what the result is, what is left after a failure and
//             which threads may call. A using-directive for this namespace makes calls ambiguous.
//   text      a result is nothing (an empty std::optional) where that function's is null. An
//             argument is read up to its first NUL character.
//   null      an argument that is nothing stands for a null pointer
//   failure   std::bad_alloc is thrown if there is no memory for a copy of a text; what the C
//             function returned is then freed. Where that function itself has no memory, nothing
//             is thrown.
#pragma once

#if !defined(__cplusplus) || __cplusplus < 201703L
#error "osutils.hpp needs C++17"
#endif

#include <stdlib.h>
#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "osutils.h"

namespace osutils {

// ---- Result codes ----

// The category of the result codes. Its messages name them in words, as "no such object".
inline const std::error_category& resultCategory() {
  class Category final : public std::error_category {
   public:
    const char* name() const noexcept override { return "osutils"; }
    std::string message(int code) const override {
      switch (code) {
        case OSUTILS_SUCCESS:
          return "success";
        case OSUTILS_OPERATIONS_ERROR:
          return "operations error";
        case OSUTILS_CONSTRAINT_VIOLATION:
          return "constraint violation";
        case OSUTILS_NO_SUCH_OBJECT:
          return "no such object";
        case OSUTILS_INVALID_CREDENTIALS:
          return "invalid credentials";
        case OSUTILS_INSUFFICIENT_ACCESS:
          return "insufficient access";
        case OSUTILS_UNAVAILABLE:
          return "unavailable";
        case OSUTILS_UNWILLING_TO_PERFORM:
          return "unwilling to perform";
        case OSUTILS_ALREADY_EXISTS:
          return "already exists";
        case OSUTILS_OTHER:
          return "other";
        case OSUTILS_PARAM_ERROR:
          return "parameter error";
        case OSUTILS_NO_MEMORY:
          return "no memory";
        default:
          return "unknown result";
      }
    }
  };
  static const Category category;
  return category;
}

// The code as a std::error_code, which is true unless the code is 0. For what checkFilePerms,
// isValidUser, the editors of files and the like return.
inline std::error_code errorCode(int code) { return {code, resultCategory()}; }

// ---- Owners ----

// Frees what a C function has allocated.
struct Free {
  // Frees one block.
  void operator()(void* memory) const noexcept { free(memory); }
  // Frees the entries and the list, unless it is null.
  void operator()(char** list) const noexcept {
    if (list == nullptr) return;
    for (char** entry = list; *entry != nullptr; ++entry) free(*entry);
    free(static_cast<void*>(list));
  }
};
// The owner of such a block: Owned<char> of a string, Owned<char*> of a list that ends with a null
// entry.
template <typename Object>
using Owned = std::unique_ptr<Object, Free>;

namespace detail {

// A copy, or nothing for null.
inline std::optional<std::string> copyOf(const char* text) {
  if (text == nullptr) return std::nullopt;
  return text;
}

// The text, or null for nothing.
inline const char* orNull(const std::optional<std::string>& text) {
  return text ? text->c_str() : nullptr;
}

}  // namespace detail

// Copies a string that a C function has made, as EtcInittab::findAvaliableID does, and frees it.
inline std::optional<std::string> take(char* text) {
  const Owned<char> owner(text);
  return detail::copyOf(text);
}

// Copies a list that a C function has made, and frees it with its entries.
inline std::optional<std::vector<std::string>> takeList(char** list) {
  const Owned<char*> owner(list);
  if (list == nullptr) return std::nullopt;
  std::vector<std::string> texts;
  for (char** entry = list; *entry != nullptr; ++entry) texts.emplace_back(*entry);
  return texts;
}

namespace detail {

// Stores the list that the function makes; an empty one if it makes none.
template <typename Function>
int storeList(std::vector<std::string>& texts, Function function) {
  char** list = nullptr;
  int count = 0;
  const int code = function(&list, &count);
  texts = takeList(list).value_or(std::vector<std::string>());
  return code;
}

}  // namespace detail

// ---- Environment variables ----

// The value of the variable; nothing if it is unset.
inline std::optional<std::string> getEnvVar(const std::string& name) {
  return take(::getEnvVar(name.c_str()));
}

// ---- Installation layout ----

// The install root.
inline std::optional<std::string> getVRAInstallPath() { return take(::getVRAInstallPath()); }
// "/var/vraldap/V6.1".
inline std::optional<std::string> getVRAVarBasePath() { return take(::getVRAVarBasePath()); }
// The directory of a version of the schema.
inline std::optional<std::string> getVRABaseSchemaDirPath(const std::string& version) {
  return take(::getVRABaseSchemaDirPath(version.c_str()));
}
// The path of ADMIN_LOG_XQ4, ADMIN_LOG_XQ4_CMDS or ADMIN_LOG_ADM; nothing for another number.
inline std::optional<std::string> getAdminLogsPath(int fileType) {
  return take(::getAdminLogsPath(fileType));
}
// The directory of the product's libraries.
inline std::optional<std::string> getVRAInstallLibPath() { return take(::getVRAInstallLibPath()); }
// The directory of the product's programs.
inline std::optional<std::string> getVRAInstallSbinPath() {
  return take(::getVRAInstallSbinPath());
}
// The launcher program.
inline std::optional<std::string> getVRAVrarunFilePath() { return take(::getVRAVrarunFilePath()); }

// ---- Database discovery ----

// The directory of the database product. Stores its version in `*version`, unless `version` is
// null.
// After failure: `*version` is untouched.
inline std::optional<std::string> getXQ4PathAndVersion(std::string* version = nullptr) {
  char* text = nullptr;
  const Owned<char> path(::getXQ4PathAndVersion(version == nullptr ? nullptr : &text));
  const Owned<char> owner(text);  // may be set without a path
  if (path && text != nullptr) *version = text;
  return detail::copyOf(path.get());
}

// ---- Files ----

// The contents of the file, without a final NUL; null after a failure. How long they are must be
// known by other means, so they cannot be a std::string.
inline Owned<char> readFile(const std::string& path) {
  char* contents = nullptr;
  (void)::readFile(path.c_str(), &contents);
  return Owned<char>(contents);
}
// The last component of the path.
inline std::optional<std::string> getFileNameFromPath(const std::string& path) {
  return take(::getFileNameFromPath(path.c_str()));
}

// What getFileOwnersAndPermissions finds. A name is nothing if memory ran out for it.
struct FileOwners {
  std::optional<std::string> owner;
  std::optional<std::string> group;
  unsigned int mode = 0;  // with the file type
};

// The owner, group and mode of the path; nothing where the C function returns false.
inline std::optional<FileOwners> getFileOwnersAndPermissions(const std::string& path) {
  char* owner = nullptr;
  char* group = nullptr;
  unsigned int mode = 0;
  if (!::getFileOwnersAndPermissions(path.c_str(), &owner, &group, &mode)) return std::nullopt;
  const Owned<char> owner_name(owner);
  const Owned<char> group_name(group);
  return FileOwners{detail::copyOf(owner), detail::copyOf(group), mode};
}

// ---- Directories ----

// "/tmp".
inline std::optional<std::string> getTempDir() { return take(::getTempDir()); }
// "/".
inline std::optional<std::string> getSystemDrive() { return take(::getSystemDrive()); }
// A copy of the name.
inline std::optional<std::string> getShortname(const std::string& name) {
  return take(::getShortname(name.c_str()));
}
// The working directory of the process.
inline std::optional<std::string> getCurrentWorkingDirectory() {
  return take(::getCurrentWorkingDirectory());
}

// ---- Time ----

// The local time; in the form for file names if the low byte of `flag` is 0.
inline std::optional<std::string> getCurrentTimeStamp(int flag) {
  return take(::getCurrentTimeStamp(flag));
}

// ---- Accounts ----

// The user's home directory, as the account database has it.
inline std::optional<std::string> vra_getpwnam_homedir(const std::string& name) {
  return take(::vra_getpwnam_homedir(name.c_str()));
}
// The group's members; nothing for an unknown group.
inline std::optional<std::vector<std::string>> vra_getgrnam_mem(const std::string& name) {
  return takeList(::vra_getgrnam_mem(name.c_str()));
}
// The account's user name, or that of the process's real user.
inline std::optional<std::string> vra_get_usr_name(
    const std::optional<std::string>& name = std::nullopt) {
  return take(::vra_get_usr_name(detail::orNull(name)));
}
// The group's name.
inline std::optional<std::string> vra_getgrgid_name(gid_t gid) {
  return take(::vra_getgrgid_name(gid));
}
// The name of the primary group of the user, or of the process's real user.
inline std::optional<std::string> getUsersPrimaryGroup(
    const std::optional<std::string>& user = std::nullopt) {
  return take(::getUsersPrimaryGroup(detail::orNull(user)));
}
// The user's home directory; "/home/USER" if the account has only "/home".
inline std::optional<std::string> getUserHomeDir(const std::string& user) {
  return take(::getUserHomeDir(user.c_str()));
}

// ---- Shared libraries ----

// Unloads a library with unloadSharedLib.
struct Unload {
  // Unloads it; errors are not reported.
  void operator()(SharedLibHandle* lib) const noexcept { (void)unloadSharedLib(lib); }
};
// A loaded library, which its destructor unloads; get() is the argument of getSymAddress.
using SharedLib = std::unique_ptr<SharedLibHandle, Unload>;

// Loads the library, or the program itself; null after a failure.
inline SharedLib loadSharedLib(const std::optional<std::string>& fileName, int mode = 0) {
  return SharedLib(::loadSharedLib(detail::orNull(fileName), mode));
}

// ---- Host addresses ----
// Results are those of the C functions: not all are result codes, so they are not std::error_code.
// A list is empty after a failure.

// Stores the addresses that the resolver has for this host's name.
inline int getAllIPAddresses(std::vector<std::string>& list) {
  return detail::storeList(list, ::getAllIPAddresses);
}
// Stores the addresses of "localhost".
inline int getLocalHostIPAddress(std::vector<std::string>& list) {
  return detail::storeList(list, ::getLocalHostIPAddress);
}
// Stores the IPv4 addresses of this host's interfaces. `conf` is scratch space.
inline int getAllIPAddresses_Linux(std::vector<std::string>& list, ifconf* conf) {
  return detail::storeList(list, [conf](char*** entries, int* count) {
    return ::getAllIPAddresses_Linux(entries, count, conf);
  });
}
// True if the address is in the list, ignoring case.
inline bool isValidIPAddressInList(std::string address, std::vector<std::string> list) {
  std::vector<char*> entries;
  entries.reserve(list.size());
  for (std::string& entry : list) entries.push_back(entry.data());
  return ::isValidIPAddressInList(address.data(), entries.data(), static_cast<int>(entries.size()));
}

// ---- Distinguished names ----

// The name in its canonical spelling.
inline std::optional<std::string> formatDn(std::string dn) { return take(::formatDn(dn.data())); }

}  // namespace osutils
