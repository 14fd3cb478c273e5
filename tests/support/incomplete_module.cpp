// A shared library that calls a function that no library has.
void missingFunction();

extern "C" __attribute__((visibility("default"))) void callMissingFunction() { missingFunction(); }
