// The metadata of a trace, which describes its files to readers.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "format.h"

namespace trc {

// Writes the program's name for file names and the metadata: characters other than letters, digits, '.', '_' and '-'
// become '_'.
void programName(char* out, size_t size);

// Writes the metadata of a trace of this process that begins now, whose packets are numbered or not. Returns its
// length, or 0 if `size` is too small. Allocates no memory.
size_t writeMetadata(char* out, size_t size, const Uuid& trace_uuid, bool are_packets_numbered);

}  // namespace trc
