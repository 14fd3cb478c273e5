/* homes GROUP: the members of a group, each with its home directory.
 *
 *     cc -std=c11 homes.c -o homes $(pkg-config --cflags --libs osutils) */
#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>

int main(int argc, char** argv) {
  if (argc != 2) {
    fprintf(stderr, "usage: homes GROUP\n");
    return 2;
  }
  char** members = vra_getgrnam_mem(argv[1]);
  if (members == NULL) {
    fprintf(stderr, "homes: there is no group \"%s\"\n", argv[1]);
    return 1;
  }
  for (char** member = members; *member != NULL; ++member) {
    char* home = getUserHomeDir(*member);
    printf("%s\t%s\n", *member, home != NULL ? home : "no such user");
    free(home);
    free(*member);
  }
  free(members);
  return 0;
}
