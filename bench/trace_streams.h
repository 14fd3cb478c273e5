// Sizes from the packet headers of the trace files.
#pragma once

#include <stddef.h>

// Returns the bytes of all records in TRC_DIR so far; 0 if it is not set. With TRC_MODE=latest it returns those of the
// calling thread, and each record that is missing counts with `bytes_of_overwritten`.
size_t recordedTraceBytes(size_t bytes_of_overwritten);
