// liborxldap: the environment of this process, as the directory's client library and its tools share it.
//
//   ldap_getenv   a new string that the caller frees; null when the variable is unset, the name is null
//                 or memory runs out
//   ldap_putenv   0 when "name=value" is now part of the environment, which keeps the very string; else
//                 -1 with the cause in errno, and the environment as it was. EINVAL for a null, a string
//                 without "=" (which putenv() would take as an order to unset the variable) and an empty
//                 name (which no program could read back)
//
// Like the C library's own, neither may run while another thread changes the environment.

#include <errno.h>
#include <stdlib.h>
#include <string.h>

#include "platform.h"

// The lock type of timed locks, and when it was decided. There is no configuration file to read here, so
// the one reading that has happened is newer than the last decision, and the environment is consulted
// once. A program that wants it consulted again raises configfile_read.
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
