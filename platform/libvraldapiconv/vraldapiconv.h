// Conversion of the directory's text, which is UTF-8, to the code set of this machine.
#pragma once

#include <stddef.h>

#pragma GCC visibility push(default)
extern "C" {

// Writes `text` in `code_set` (null: that of the current locale) to the buffer, followed by a NUL byte,
// and returns the number of bytes before it. -1 with the cause in errno, and the empty string in the
// buffer: EILSEQ for text that is not UTF-8 or has a character that the code set lacks, E2BIG when the
// buffer is too small, EINVAL for a null, an empty buffer, an unknown code set or text that ends in the
// middle of a character.
long vraldap_from_utf8(const char* code_set, const char* text, char* buffer, size_t size);

}  // extern "C"
#pragma GCC visibility pop
