// liborxldap: the environment of this process.
//
//   ldap_getenv   returns a new string that the caller frees; null if the variable is unset, the name is null or memory
//                 runs out
//   ldap_putenv   returns 0 if "name=value" is now in the environment, which keeps the string itself; else -1 with the
//                 cause in errno, and the environment is unchanged. EINVAL for a null, a string without "=" (putenv()
//                 would unset the variable) and an empty name (no program could read it)
//
// Like getenv() and putenv(), neither may run while another thread changes the environment.

#include <errno.h>
#include <stdlib.h>
#include <string.h>

#include "platform.h"

// The type of timed locks, the number of times that the configuration was read, and that number when the lock type was
// last decided. There is no configuration file here: the number starts at 1, so the environment is read once. A program
// that wants it read again increments configfile_read.
int default_autolock = 1;
int configfile_read = 1;
int al_configfile_counter = 0;

char* ldap_getenv(const char* name) {
  if (name == nullptr) return nullptr;
  const char* value = getenv(name);
  return value == nullptr ? nullptr : strdup(value);
}

int ldap_putenv(char* assignment) {
  if (assignment == nullptr || assignment[0] == '=' || strchr(assignment, '=') == nullptr) {
    errno = EINVAL;
    return -1;
  }
  return putenv(assignment);
}
