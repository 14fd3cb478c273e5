#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>

int main(void) {
  char* owner = NULL;
  char* group = NULL;
  unsigned int mode = 0;
  if (getFileOwnersAndPermissions("/etc", &owner, &group, &mode)) {
    /* The mode has the file type, too. */
    printf("%s %s %o\n", owner != NULL ? owner : "?", group != NULL ? group : "?", mode & 07777);
  }
  free(owner);
  free(group);
  return 0;
}

/* Prints:
 * root root 755
 */
