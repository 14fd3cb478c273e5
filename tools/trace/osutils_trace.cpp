// osutils-trace: the trace commands of osutils.
#include "commands.h"
#include "program.h"

int main(int argc, char** argv) {
  return runProgram(argc, argv, [](Tool& tool) {
    traces::addCommands(tool,
                        {[&tool](traces::Options& options) { return summarize(tool, options); }});
  });
}
