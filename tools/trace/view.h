// What the views of traces share.
#pragma once

#include "calls.h"
#include "commands.h"

namespace traces {

// Reads the paths of the options, with their names and their range of time, and shows the progress on a terminal, but
// not if the view is writing to standard output meanwhile and that is a terminal, too. Reports what could not be read;
// fails if nothing could.
Reading readCalls(Tool& tool, const Options& options, Visitor& visitor, bool is_writing = false);
// For views that read twice. Reports only what could not be read now, if that is more than before.
Reading readAgain(Tool& tool, const Options& options, Visitor& visitor, const Reading& before,
                  bool is_writing = false);
// Says how many records the second reading did not find again; empty if it found all.
std::string lossOf(const Reading& before, const Reading& again);

// "1 record", "2 records"
std::string counted(uint64_t number, const char* what);
// "2026-01-31T12:00:00.000000005Z"
std::string timeText(int64_t time);
// The same without a fraction or "Z", too. Wrong usage if it is anything else.
int64_t timeFrom(const std::string& text, const char* option);

// "12ns", "3.46us", "1.20ms", "15.0s": three or more digits.
std::string durationText(int64_t nanoseconds);
// "5ms", "0.5s". Wrong usage if it is anything else.
int64_t durationFrom(const std::string& text, const char* option);

}  // namespace traces
