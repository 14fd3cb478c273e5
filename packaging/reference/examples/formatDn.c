#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>

int main(void) {
  char typed[] = "cn = Ann Example ; o=acme";
  char* name = formatDn(typed);
  printf("%s\n", name != NULL ? name : "no name");
  free(name);
  return 0;
}

/* Prints:
 * CN=ANN EXAMPLE,O=ACME
 */
