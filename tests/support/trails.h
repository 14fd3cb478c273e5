// The records that calls leave, as Records::trail() gives them, for what editors of files call.
#pragma once

#include <pwd.h>
#include <unistd.h>

#include <string>
#include <vector>

using Trail = std::vector<std::string>;

inline Trail operator+(Trail first, const Trail& second) {
  first.insert(first.end(), second.begin(), second.end());
  return first;
}

// The records of one call and of what it calls.
inline Trail call(const std::string& name, int code, const Trail& inside = {}) {
  return Trail{"> " + name} + inside +
         Trail{(code == 0 ? "< " : "<! ") + name + " " + std::to_string(code)};
}

inline const Trail kGoodFile =
    call("checkFilePerms", 0, call("doesFileExist", 1) + call("isDirectory", 0));
inline const Trail kDeleted = call("deleteFile", 1, call("isDirectory", 0));

inline Trail missing(const std::string& query, int code) {
  return call(query, code, {"D " + query + ": stat() - errno=2\n"});
}

inline const Trail kCopySource =
    call("doesFileExist", 1) + call("canAccessFile", 1) + call("isDirectory", 0);

// A copy to a new file, which then belongs to the user of this process.
inline Trail copiedToNewFile() {
  const std::string uid = std::to_string(getuid());
  const std::string gid = std::to_string(getpwuid(getuid())->pw_gid);
  return call("copyFile", 1,
              kCopySource + missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                  call("createFile", 1,
                       missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                           call("setFileOwnersAndPermissions", 1,
                                {"D vra_get_uid: name=NULL uid=" + uid + "\n",
                                 "D vra_get_usr_gid: name=NULL gid=" + gid + "\n",
                                 "D vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid + "\n"})));
}
