/* The version that the header states, in both spellings: they must agree. */
#include <osutils.h>
#include <stdio.h>
#include <string.h>

int main(void) {
  char numbers[64];
  snprintf(numbers, sizeof numbers, "%d.%d.%d", OSUTILS_VERSION_MAJOR, OSUTILS_VERSION_MINOR,
           OSUTILS_VERSION_PATCH);
  puts(OSUTILS_VERSION);
  return strcmp(numbers, OSUTILS_VERSION) != 0;
}
