// The records that calls leave, as Records::trail() gives them.
#pragma once

#include <errno.h>
#include <pwd.h>
#include <unistd.h>

#include <string>
#include <vector>

using Trail = std::vector<std::string>;

template <typename... Parts>
Trail joined(const Parts&... parts) {
  Trail all;
  (all.insert(all.end(), parts.begin(), parts.end()), ...);
  return all;
}
inline Trail operator+(const Trail& first, const Trail& second) { return joined(first, second); }

// Messages of the two levels; with a newline at the end for those that have one.
inline Trail debug(const std::string& text) { return {"D " + text}; }
inline Trail debugLine(const std::string& text) { return debug(text + "\n"); }
inline Trail error(const std::string& text) { return {"E " + text}; }
inline Trail errorLine(const std::string& text) { return error(text + "\n"); }

// A call with the records inside it.
template <typename... Inner>
Trail call(const std::string& name, long code, const Inner&... inner) {
  const std::string exit = code == 0 ? "< " : "<! ";
  return joined(Trail{"> " + name}, inner..., Trail{exit + name + " " + std::to_string(code)});
}
inline Trail yes(const std::string& name) { return call(name, 1); }
inline Trail no(const std::string& name) { return call(name, 0); }

// A query whose stat() fails.
inline Trail query(const std::string& name, long code, int error_number) {
  return call(name, code, debugLine(name + ": stat() - errno=" + std::to_string(error_number)));
}
inline Trail missing(const std::string& name, long code) { return query(name, code, ENOENT); }
// Both queries of a path that does not exist.
inline Trail missing() { return joined(missing("doesFileExist", 0), missing("canAccessFile", 1)); }

// The look-ups of the account of this process.
inline Trail ownAccount() {
  const passwd* const user = getpwuid(getuid());
  const std::string gid = std::to_string(user == nullptr ? 0 : user->pw_gid);
  return joined(debugLine("vra_get_uid: name=NULL uid=" + std::to_string(getuid())),
                debugLine("vra_get_usr_gid: name=NULL gid=" + gid),
                debugLine("vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid));
}
inline Trail givenToOwnAccount() { return call("setFileOwnersAndPermissions", 1, ownAccount()); }
inline Trail createdForOwnAccount() {
  return call("createFile", 1, missing(), givenToOwnAccount());
}

inline const Trail kGoodFile = call("checkFilePerms", 0, yes("doesFileExist"), no("isDirectory"));
inline const Trail kDeleted = call("deleteFile", 1, no("isDirectory"));

// The queries of a source that copyFile accepts.
inline const Trail kCopySource =
    joined(yes("doesFileExist"), yes("canAccessFile"), no("isDirectory"));
// A copy to a new file of the user of this process.
inline Trail copiedToNewFile() {
  return call("copyFile", 1, kCopySource, missing(), createdForOwnAccount());
}
