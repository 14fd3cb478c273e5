#include <osutils.h>
#include <stdio.h>

int main(void) {
  char one[] = "inst1";
  char command[] = "inst1; id";
  char words[] = "-I inst1 #"; /* blanks, options and comments pass */
  printf("%d %d %d\n", checkForMetaChars(one), checkForMetaChars(command),
         checkForMetaChars(words));
  return 0;
}

/* Prints:
 * 0 1 0
 */
