// osutils-trace: the trace commands of osutils.
#include "commands.h"
#include "program.h"

int main(int argc, char** argv) {
  return runProgram(argc, argv, [](Tool& tool) {
    const auto view = [&tool](Answer (*show)(Tool&, traces::Options&)) {
      return [&tool, show](traces::Options& options) { return show(tool, options); };
    };
    traces::addCommands(tool,
                        {view(traces::summarize), view(traces::showTree), view(traces::exportCalls),
                         [&tool](traces::Options& options, bool dry_run) {
                           return traces::reportCalls(tool, options, dry_run);
                         }});
  });
}
