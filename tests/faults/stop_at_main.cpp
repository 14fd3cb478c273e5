// Preloaded: stops the program with SIGSTOP right before main.
#include <dlfcn.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

namespace {

using Main = int(int, char**, char**);
Main* program_main;

int stopAndRun(int count, char** arguments, char** environment) {
  unsetenv("LD_PRELOAD");  // for the programs that this one starts
  kill(getpid(), SIGSTOP);
  return program_main(count, arguments, environment);
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int __libc_start_main(
    Main* main, int count, char** arguments, void (*init)(), void (*fini)(), void (*loader_fini)(),
    void* stack_end) {
  program_main = main;
  const auto start =
      reinterpret_cast<decltype(&__libc_start_main)>(dlsym(RTLD_NEXT, "__libc_start_main"));
  return start(stopAndRun, count, arguments, init, fini, loader_fini, stack_end);
}
