// The directory of one process's trace.
#pragma once

#include <stdint.h>
#include <sys/types.h>

namespace trc {

struct TraceDirectory {
  char name[128];  // below the root directory
  dev_t device;
  ino_t inode;
  uint8_t uuid[16];
};

// Makes the directory that holds the traces, unless it is there. Answers whether traces can be made in it.
bool makeRoot(const char* root);

// Makes a new trace in `root`. It gets its name when its metadata is complete. Callers take turns.
bool makeTraceDirectory(const char* root, TraceDirectory& out);

// Opens it again, or answers -1 when it is not there any more: by its name alone it could be another one.
// No descriptor is kept open meanwhile, because programs close or reuse descriptors they do not know.
int openTraceDirectory(const char* root, const TraceDirectory& directory);

// True when a file may grow to this size. A file that is too large for the limit of its process does
// not only fail, it also brings a signal that ends the program.
bool isFileSizeAllowed(uint64_t bytes);

}  // namespace trc
