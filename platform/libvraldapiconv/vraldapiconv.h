// Conversion of UTF-8, which is the directory's code set, to other code sets.
#pragma once

#include <stddef.h>

#pragma GCC visibility push(default)
extern "C" {

// Writes `text`, converted to `code_set` (null: the current locale's), and a NUL to the buffer. Returns the number
// of bytes before the NUL. After a failure returns -1 with the cause in errno, and the buffer holds the empty string:
// EILSEQ if the text is not UTF-8 or has a character that the code set lacks, E2BIG if the buffer is too small, EINVAL
// for a null, an empty buffer, an unknown code set or text that ends in the middle of a character.
long vraldap_from_utf8(const char* code_set, const char* text, char* buffer, size_t size);

}  // extern "C"
#pragma GCC visibility pop
