// The text that tells a reader of a trace what is in its files.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace trc {

// The program's name, with everything but letters, digits, '.', '_' and '-' replaced: it becomes part of
// file names and of the metadata.
void programName(char* out, size_t size);

// Writes the metadata of a trace of this process that begins now. Answers its length, or 0 when `size`
// is too small. Allocates no memory.
size_t writeMetadata(char* out, size_t size, const uint8_t (&trace_uuid)[16]);

}  // namespace trc
