#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>

int main(void) {
  putEnvVar("VRA_LDAP_HOME", "/srv/ldap/");
  char* path = getVRAInstallPath();
  printf("%s\n", path != NULL ? path : "no memory");
  free(path);
  return 0;
}

/* Prints:
 * /srv/ldap
 */
