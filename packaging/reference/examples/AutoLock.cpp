#include <ldtr.h>

#include <cstdio>

static pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;

int main() {
  try {
    const AutoLock lock(&mutex, true);  // waits about 600 s at most
    std::puts("locked");
  } catch (const char* text) {
    std::puts(text);
    return 1;
  }
  return 0;
}

// Prints:
// locked
