// osutils: the library's functions on the command line.
#include "command.h"
#include "program.h"
#ifdef OSUTILS_BIN_TO_READER
#include "trace/forward.h"
#endif

int main(int argc, char** argv) {
  return runProgram(argc, argv, [argv](Tool& tool) {
    services::addCommands(tool);
    paths::addCommands(tool);
    files::addCommands(tool);
    accounts::addCommands(tool);
    checks::addCommands(tool);
    inittab::addCommands(tool);
    processes::addCommands(tool);
    network::addCommands(tool);
    names::addCommands(tool);
#ifdef OSUTILS_BIN_TO_READER
    traces::forwardCommands(tool, argv);
#else
    (void)argv;
#endif
  });
}
