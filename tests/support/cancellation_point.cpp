// A shared library whose unloading is a cancellation point.
#include <pthread.h>

__attribute__((destructor)) static void waitAtTheEnd() { pthread_testcancel(); }
