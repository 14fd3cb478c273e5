/* A C11 program that uses only the installed library: client FILE, whose contents begin with "demo". */
#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

int main(int argc, char** argv) {
  if (argc != 2) return 2;

  char* contents = NULL;
  char* name = getFileNameFromPath(argv[1]);
  const int works = checkFilePerms(argv[1]) == LDAP_SUCCESS &&
                    checkFilePerms("/") == OSUTILS_CONSTRAINT_VIOLATION &&
                    readFile(argv[1], &contents) && strncmp(contents, "demo", 4) == 0 &&
                    name != NULL && strcmp(name, strrchr(argv[1], '/') + 1) == 0;
  free(contents);
  free(name);
  puts(works ? "C client: works" : "C client: wrong answer");
  return !works;
}
