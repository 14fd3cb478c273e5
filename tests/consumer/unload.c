/* Loads the library, calls it, and checks that dlclose() unloads it: unload LIBRARY. */
#include <dlfcn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

static int is_mapped(const char* name) {
  char line[4096];
  int found = 0;
  FILE* maps = fopen("/proc/self/maps", "r");
  if (maps == NULL) abort();
  while (fgets(line, sizeof line, maps) != NULL) found = found || strstr(line, name) != NULL;
  fclose(maps);
  return found;
}

int main(int argc, char** argv) {
  if (argc != 2) return 2;

  void* library = dlopen(argv[1], RTLD_NOW);
  if (library == NULL) {
    fprintf(stderr, "%s\n", dlerror());
    return 1;
  }
  int (*check)(const char*) = NULL;
  *(void**)&check = dlsym(library, "checkFilePerms");
  const int works =
      check != NULL && check("/") == 19 && is_mapped("/libosutils.so") && dlclose(library) == 0;
  if (!works || is_mapped("/libosutils.so")) {
    puts("unload: failed");
    return 1;
  }
  puts("unload: works");
  return 0;
}
