// Sizes from the packet headers of the trace files.
#pragma once

#include <stddef.h>

// Returns the bytes of all records in TRC_DIR so far; 0 if it is not set.
size_t recordedTraceBytes();
