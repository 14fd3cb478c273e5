#include "program.h"

#include <cxxabi.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <exception>
#include <new>
#include <typeinfo>

namespace {

// Keeps a file that the library opens from becoming a closed standard stream. Opened read-only, so that
// writing to standard output fails.
void reserveStandardStreams() {
  for (const int descriptor : {0, 1, 2}) {
    if (fcntl(descriptor, F_GETFD) != -1 || errno != EBADF) continue;
    if (open("/dev/null", O_RDONLY) == -1) (void)open("/", O_RDONLY | O_DIRECTORY);
  }
}

void reportNoMemory() { (void)fputs("osutils: no memory (90)\n", stderr); }

// The JSON library allocates in destructors, and the C++ library in other functions that must not
// throw: they end the program if they cannot.
[[noreturn]] void onTerminate() {
  const std::type_info* const type = abi::__cxa_current_exception_type();
  // The type is unknown where the exception is not caught yet.
  const bool is_memory =
      type != nullptr ? *type == typeid(std::bad_alloc) : std::uncaught_exceptions() > 0;
  if (!is_memory) abort();
  reportNoMemory();
  _exit(kFailure);
}

// Before the static objects are constructed: they allocate.
__attribute__((constructor(101))) void setTerminate() { std::set_terminate(onTerminate); }

}  // namespace

int runProgram(int argc, char** argv, const std::function<void(Tool&)>& addCommands) {
  reserveStandardStreams();
  signal(SIGCHLD, SIG_DFL);  // if ignored, the library's shell commands lose their exit status
  signal(SIGPIPE, SIG_IGN);  // writing to a closed pipe fails like any other write
  signal(SIGXFSZ, SIG_IGN);  // so does writing beyond the file size limit
  try {
    Tool tool;
    // The commands take a third of the time of a start.
    const bool asks_for_version = argc == 2 && strcmp(argv[1], "--version") == 0;
    if (!asks_for_version) addCommands(tool);
    return tool.run({argv + std::min(argc, 1), argv + argc});
  } catch (const std::bad_alloc&) {
    reportNoMemory();
  } catch (const std::exception& error) {
    (void)fprintf(stderr, "osutils: other (80): %s\n", error.what());
  }
  return kFailure;
}
