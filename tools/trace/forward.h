#pragma once

#include "command.h"

namespace traces {

// Adds the trace commands. They replace this program by osutils-trace with the same words.
void forwardCommands(Tool& tool, char** words);

}  // namespace traces
