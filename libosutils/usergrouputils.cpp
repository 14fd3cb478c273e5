// Users and groups: thread-safe look-ups, queries, and valid names; the ownership of files.

#include <errno.h>
#include <grp.h>
#include <pthread.h>
#include <pwd.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include "cancellation.h"
#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "text.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::isNullOrEmpty;
using osutils::OwnedList;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

constexpr int kNotFound = -99;

pthread_mutex_t usrgrp_mutex;

extern "C" void init_usrgrp_mutex_once() { (void)pthread_mutex_init(&usrgrp_mutex, nullptr); }

void init_usrgrp_mutex() {
  static pthread_once_t initUsrGrpMutexOnceFlag = PTHREAD_ONCE_INIT;
  (void)pthread_once(&initUsrGrpMutexOnceFlag, init_usrgrp_mutex_once);
}

// Calls `look_up` with the mutex locked, because the C library's functions return static storage.
// If the mutex cannot be locked, returns `on_lock_failure` without a look-up.
template <typename Result, typename LookUp>
Result lookUpSerialized(Result on_lock_failure, LookUp look_up) {
  init_usrgrp_mutex();
  // A thread cancelled in the look-up would leave the C library's mutex locked.
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  if (pthread_mutex_lock(&usrgrp_mutex) != 0) return on_lock_failure;
  const Result result = look_up();
  (void)pthread_mutex_unlock(&usrgrp_mutex);
  return result;
}

// A null name means the real user of the process, not the effective one.
passwd* findUser(const char* name) { return name != nullptr ? getpwnam(name) : getpwuid(getuid()); }

const char* orNull(const char* name) { return name != nullptr ? name : "NULL"; }

// sic: messages print a pointer with "%d" instead of the text.
int low32Bits(const void* pointer) { return static_cast<int>(reinterpret_cast<intptr_t>(pointer)); }

// Returns null if memory runs out: a shortened list would deny that a user is a member.
char** copyList(char** list) {
  size_t count = 0;
  while (list[count] != nullptr) ++count;
  OwnedList copy(static_cast<char**>(calloc(count + 1, sizeof(char*))));
  if (!copy) return nullptr;
  for (size_t i = 0; i < count; ++i) {
    char* const entry = strdup(list[i]);
    if (entry == nullptr) return nullptr;
    copy.get()[i] = entry;
  }
  return copy.release();
}

}  // namespace

// ---- Look-ups ----

int vra_getpwnam_uid(const char* name) {
  int uid = kNotFound;
  if (!isNullOrEmpty(name)) {
    // sic: 0, root's id, if the mutex cannot be locked, here and in the two group look-ups.
    uid = lookUpSerialized(0, [&] {
      const passwd* const user = getpwnam(name);
      return user != nullptr ? static_cast<int>(user->pw_uid) : kNotFound;
    });
  }
  DEBUG_MESSAGE(ldtr_fun, "vra_getpwnam_uid: name=%s uid=%d\n", orNull(name), uid);
  return uid;
}

int vra_getgrnam_gid(const char* name) {
  int gid = kNotFound;
  if (!isNullOrEmpty(name)) {
    gid = lookUpSerialized(0, [&] {
      const group* const found = getgrnam(name);
      return found != nullptr ? static_cast<int>(found->gr_gid) : kNotFound;
    });
  }
  DEBUG_MESSAGE(ldtr_fun, "vra_getgrnam_gid: name=%s gid=%d\n", orNull(name), gid);
  return gid;
}

char* vra_getpwnam_homedir(const char* name) {
  char* const home = lookUpSerialized<char*>(nullptr, [&] {
    const passwd* const user = getpwnam(name);
    return user != nullptr ? strdup(user->pw_dir) : nullptr;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_getpwnam_homedir: name=%s dir=%d\n", orNull(name), low32Bits(home));
  return home;
}

char** vra_getgrnam_mem(const char* name) {
  char** members = nullptr;
  if (!isNullOrEmpty(name)) {
    members = lookUpSerialized<char**>(nullptr, [&]() -> char** {
      const group* const found = getgrnam(name);
      return found != nullptr && found->gr_mem != nullptr ? copyList(found->gr_mem) : nullptr;
    });
  }
  // sic: "ldap", not "vra".
  DEBUG_MESSAGE(ldtr_fun, "ldap_getgrnam_mem: name=%s ret_grpList=%d\n", orNull(name),
                low32Bits(members));
  return members;
}

int vra_get_uid(const char* name) {
  const int uid = lookUpSerialized(kNotFound, [&] {
    const passwd* const user = findUser(name);
    return user != nullptr ? static_cast<int>(user->pw_uid) : kNotFound;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_get_uid: name=%s uid=%d\n", orNull(name), uid);
  return uid;
}

int vra_get_usr_gid(const char* name) {
  const int gid = lookUpSerialized(kNotFound, [&] {
    const passwd* const user = findUser(name);
    return user != nullptr ? static_cast<int>(user->pw_gid) : kNotFound;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_get_usr_gid: name=%s gid=%d\n", orNull(name), gid);
  return gid;
}

char* vra_get_usr_name(const char* name) {
  char* const user_name = lookUpSerialized<char*>(nullptr, [&] {
    const passwd* const user = findUser(name);
    return user != nullptr ? strdup(user->pw_name) : nullptr;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_get_usr_name: name=%s ret_name=%d\n", orNull(name),
                low32Bits(user_name));
  return user_name;
}

int vra_getgrgid_gid(gid_t gid) {
  const int found_gid = lookUpSerialized(0, [&] {
    const group* const found = getgrgid(gid);
    return found != nullptr ? static_cast<int>(found->gr_gid) : kNotFound;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_getgrgid_gid: gid=%d ret_gid=%d\n", static_cast<int>(gid),
                found_gid);
  return found_gid;
}

char* vra_getgrgid_name(gid_t gid) {
  char* const name = lookUpSerialized<char*>(nullptr, [&] {
    const group* const found = getgrgid(gid);
    return found != nullptr ? strdup(found->gr_name) : nullptr;
  });
  DEBUG_MESSAGE(ldtr_fun, "vra_getgrgid_name: gid=%d ret_name=%d\n", static_cast<int>(gid),
                low32Bits(name));
  return name;
}

// ---- Ownership ----

TRACED bool setFileOwnersAndPermissions(int descriptor, char* path, char* user, char* group,
                                        unsigned int mode) {
  TraceScope<traced::setFileOwnersAndPermissions> trace;

  if (path == nullptr) {
    ERROR_MESSAGE(trace, "setFileOwnersAndPermissions: passed a null pointer.\n");
    return trace.result(false);
  }
  const int uid = vra_get_uid(user);
  if (uid == kNotFound) {
    DEBUG_MESSAGE(trace, "setFileOwnersAndPermissions: user %s does not exist.\n", user);
    return trace.result(false);
  }
  int gid = vra_get_usr_gid(user);
  if (gid == kNotFound) {
    DEBUG_MESSAGE(trace, "setFileOwnersAndPermissions: user's %s group does not exist.\n", user);
    return trace.result(false);
  }
  gid = group != nullptr ? vra_getgrnam_gid(group) : vra_getgrgid_gid(static_cast<gid_t>(gid));
  if (gid == kNotFound) {
    ERROR_MESSAGE(trace, "setFileOwnersAndPermissions: group %s does not exist.\n", group);
    return trace.result(false);
  }

  const uid_t owner = static_cast<uid_t>(uid);
  const gid_t owner_group = static_cast<gid_t>(gid);
  int rc = 0;
  if (descriptor == FILE_DESC_USE_PATH) {
    rc = chown(path, owner, owner_group);
  } else if (descriptor == FILE_DESC_USE_LINK_PATH) {
    rc = lchown(path, owner, owner_group);
  } else {
    rc = fchown(descriptor, owner, owner_group);
  }
  if (rc != 0) {
    ERROR_MESSAGE(trace, "setFileOwnersAndPermissions: chown failed with errno=%d.\n", errno);
    // sic: tolerated for a path only, because an ordinary user may set the mode of its own file.
    if (descriptor != FILE_DESC_USE_PATH) return trace.result(false);
  }
  if (descriptor == FILE_DESC_USE_LINK_PATH) return trace.result(true);

  rc = descriptor == FILE_DESC_USE_PATH ? chmod(path, mode) : fchmod(descriptor, mode);
  if (rc != 0) {
    ERROR_MESSAGE(trace, "setFileOwnersAndPermissions: chmod failed with errno=%d.\n", errno);
    return trace.result(false);
  }
  return trace.result(true);
}

// ---- Users and groups ----

TRACED char* getUsersPrimaryGroup(const char* user) {
  TraceScope<traced::getUsersPrimaryGroup> trace;

  const int gid = vra_get_usr_gid(user);
  if (gid == kNotFound) {
    DEBUG_MESSAGE(trace, "getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n");
    return nullptr;
  }
  char* const name = vra_getgrgid_name(static_cast<gid_t>(gid));
  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "getUsersPrimaryGroup: vra_getgrgid_name did not find group.\n");
  }
  return name;
}

TRACED bool isMemberOfGroup(const char* user, const char* group) {
  TraceScope<traced::isMemberOfGroup> trace;

  if (group == nullptr) {
    DEBUG_MESSAGE(trace, "isMemberOfGroup: NULL pointer passed in.\n");
    return trace.result(false);
  }
  OwnedString own_name;
  if (user == nullptr) {
    own_name.reset(vra_get_usr_name(nullptr));
    if (!own_name) {
      DEBUG_MESSAGE(trace, "isMemberOfGroup: vra_get_usr_name could not find user.\n");
      return trace.result(false);
    }
  }
  const OwnedList members(vra_getgrnam_mem(group));
  if (!members) {
    DEBUG_MESSAGE(trace, "isMemberOfGroup: vra_getgrnam_mem did not find group.\n");
    return trace.result(false);
  }
  // sic: for a null user only the primary group counts.
  if (user != nullptr) {
    for (char** member = members.get(); *member != nullptr; ++member) {
      if (strcasecmp(*member, user) == 0) return trace.result(true);
    }
  }
  const OwnedString primary(getUsersPrimaryGroup(user != nullptr ? user : own_name.get()));
  return trace.result(primary && strcasecmp(primary.get(), group) == 0);
}

TRACED int isValidUser(const char* user, const void* extra) {
  TraceScope<traced::isValidUser> trace;

  if (user == nullptr && extra == nullptr) {
    DEBUG_MESSAGE(trace, "isValidUser: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  // The name is not quoted in the command below.
  if (checkForMetaChars(const_cast<char*>(user))) {
    DEBUG_MESSAGE(trace, "isValidUser: passed in meta characters.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (!doesUserExist(user)) return trace.result(OSUTILS_NO_SUCH_OBJECT);
  // Only root can run su without a password.
  if (static_cast<int>(getuid()) != vra_getpwnam_uid("root")) return trace.result(OSUTILS_SUCCESS);

  char* text = nullptr;
  if (vra_asprintf(&text, "%s/su %s -c \"exit 0\" >>%s 2>>%s ", "/bin", user, "/dev/null",
                   "/dev/null") == -1) {
    DEBUG_MESSAGE(trace, "isValidUser: vra_asprintf failed.\n");
    return trace.result(OSUTILS_OTHER);
  }
  OwnedString command(text);
  DEBUG_MESSAGE(trace, "isValidUser: command=%s.\n", command.get());
  const int rc = system(command.get());
  command.reset();
  if (rc != 0) {
    DEBUG_MESSAGE(trace, "isValidUser: command rc=%d.\n", rc);
    return trace.result(OSUTILS_INVALID_CREDENTIALS);
  }
  return trace.result(OSUTILS_SUCCESS);
}

TRACED bool doesUserExist(const char* user) {
  TraceScope<traced::doesUserExist> trace;

  if (user == nullptr) {
    DEBUG_MESSAGE(trace, "doesUserExist: passed a null pointer.\n");
    return trace.result(false);
  }
  return trace.result(vra_getpwnam_uid(user) != kNotFound);
}

TRACED char* getUserHomeDir(const char* user) {
  TraceScope<traced::getUserHomeDir> trace;

  if (user == nullptr) {
    DEBUG_MESSAGE(trace, "getUserHomeDir: passed a null pointer.\n");
    return nullptr;
  }
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  setpwent();
  OwnedString home(vra_getpwnam_homedir(user));
  if (!home) {
    // sic: also for an unknown user.
    // sic: leaked deliberately, the open password database.
    DEBUG_MESSAGE(trace, "getUserHomeDir: ran out of memory.\n");
    return nullptr;
  }
  if (strcasecmp(home.get(), "/home") == 0) {
    DEBUG_MESSAGE(trace, "getUserHomeDir: Adding '%s' to home dir path.\n", user);
    home.reset();
    char* text = nullptr;
    if (vra_asprintf(&text, "%s/%s", "/home", user) == -1) {
      DEBUG_MESSAGE(trace, "getUserHomeDir: vra_asprintf failed\n");
      return nullptr;
    }
    home.reset(text);
  }
  endpwent();
  return home.release();
}

TRACED bool doesGroupExist(const char* group) {
  TraceScope<traced::doesGroupExist> trace;

  if (group == nullptr) {
    DEBUG_MESSAGE(trace, "doesGroupExist: passed a null pointer.\n");
    return trace.result(false);
  }
  return trace.result(vra_getgrnam_gid(group) != kNotFound);
}

// ---- Names ----

TRACED bool isValidName(char* name) {
  TraceScope<traced::isValidName> trace;

  if (name == nullptr || name[0] == '\0') {
    DEBUG_MESSAGE(trace, "isValidName: Passed a NULL or empty name.\n");
    return trace.result(false);
  }
  const size_t length = strlen(name);
  if (length > 8) {
    DEBUG_MESSAGE(trace, "isValidName: Error: Length violation.\n");
    return trace.result(false);
  }
  for (const char* c = name; *c != '\0'; ++c) {
    if (!osutils::isDigit(*c) && !osutils::isLetter(*c) && *c != '_') {
      DEBUG_MESSAGE(trace, "isValidName: Error: Character range violation.\n");
      return trace.result(false);
    }
    if (c == name && !osutils::isLetter(*c)) {
      DEBUG_MESSAGE(trace, "isValidName: Error: Not starting with a letter.\n");
      return trace.result(false);
    }
  }
  for (const char* prefix : {"orx", "sql", "sys"}) {
    if (strncasecmp(name, prefix, 3) == 0) {
      DEBUG_MESSAGE(trace, "isValidName: Error: Cannot start with ORX, SYS or SQL.\n");
      return trace.result(false);
    }
  }
  for (const char* reserved : {"Users", "Admins", "guests", "public", "local"}) {
    if (length == strlen(reserved) && strncasecmp(name, reserved, length) == 0) {
      DEBUG_MESSAGE(trace,
                    "isValidName: Error: Cannot be anyone of Users, Admins, guests, public and "
                    "local.\n");
      return trace.result(false);
    }
  }
  return trace.result(true);
}
