// A program that calls the library once, in vain.
#include <stdio.h>

#include "osutils.h"

int main() { return printf("answer %d\n", doesFileExist("")) < 0; }
