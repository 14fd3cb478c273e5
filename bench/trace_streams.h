// What the trace files of this process say of their own content.
#pragma once

#include <stddef.h>

// The bytes of all records below TRC_DIR so far; 0 without one.
size_t recordedTraceBytes();
