// What the programs osutils and osutils-trace share.
#pragma once

#include <functional>

#include "command.h"

// Prepares the process, runs the command line and returns the exit status.
int runProgram(int argc, char** argv, const std::function<void(Tool&)>& addCommands);
