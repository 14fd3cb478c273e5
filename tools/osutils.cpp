// osutils: the library's functions on the command line.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>

#include <new>

#include "command.h"

namespace {

// A file that the library opens must not take the place of a closed standard output. Opened to read
// only, so that writing fails.
void reserveStandardStreams() {
  for (const int descriptor : {0, 1, 2}) {
    if (fcntl(descriptor, F_GETFD) == -1) (void)open("/dev/null", O_RDONLY);
  }
}

}  // namespace

int main(int argc, char** argv) {
  reserveStandardStreams();
  signal(SIGCHLD, SIG_DFL);  // ignored, it would take the status of the library's shell commands
  signal(SIGPIPE, SIG_IGN);  // a reader that went away is a failed write like any other
  signal(SIGXFSZ, SIG_IGN);  // and so is a file that may not grow
  try {
    Tool tool;
    services::addCommands(tool);
    paths::addCommands(tool);
    files::addCommands(tool);
    accounts::addCommands(tool);
    checks::addCommands(tool);
    inittab::addCommands(tool);
    processes::addCommands(tool);
    network::addCommands(tool);
    names::addCommands(tool);
    return tool.run({argv + std::min(argc, 1), argv + argc});
  } catch (const std::bad_alloc&) {
    (void)fputs("osutils: no memory (90)\n", stderr);
  } catch (const std::exception& error) {
    (void)fprintf(stderr, "osutils: other (80): %s\n", error.what());
  }
  return kFailure;
}
