// The records that calls leave, as Records::trail() gives them, for what editors of files call.
#pragma once

#include <pwd.h>
#include <unistd.h>

#include <string>

#include "calls.h"

inline Trail operator+(const Trail& first, const Trail& second) { return joined(first, second); }

inline const Trail kGoodFile =
    call("checkFilePerms", 0, call("doesFileExist", 1) + call("isDirectory", 0));
inline const Trail kDeleted = call("deleteFile", 1, call("isDirectory", 0));

inline Trail missing(const std::string& query, int code) {
  return call(query, code, Trail{"D " + query + ": stat() - errno=2\n"});
}

inline const Trail kCopySource =
    call("doesFileExist", 1) + call("canAccessFile", 1) + call("isDirectory", 0);

// A copy to a new file, which then belongs to the user of this process.
inline Trail copiedToNewFile() {
  const std::string uid = std::to_string(getuid());
  const std::string gid = std::to_string(getpwuid(getuid())->pw_gid);
  return call(
      "copyFile", 1,
      kCopySource + missing("doesFileExist", 0) + missing("canAccessFile", 1) +
          call("createFile", 1,
               missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                   call("setFileOwnersAndPermissions", 1,
                        Trail{"D vra_get_uid: name=NULL uid=" + uid + "\n",
                              "D vra_get_usr_gid: name=NULL gid=" + gid + "\n",
                              "D vra_getgrgid_gid: gid=" + gid + " ret_gid=" + gid + "\n"})));
}
