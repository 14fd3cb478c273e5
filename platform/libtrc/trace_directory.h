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

// The first file of a stream. Small, because many threads are short-lived.
constexpr uint64_t kFirstFileBytes = 4 << 10;

// Makes a new trace in `root`, and `root` itself unless it is there. The trace gets its name when its metadata
// is complete and there is room for a first file. Callers take turns.
bool makeTraceDirectory(const char* root, TraceDirectory& out);

// Opens it again, or returns -1 when it is not there any more: by its name alone it could be another one.
// No descriptor is kept open meanwhile, because programs close or reuse descriptors they do not know.
int openTraceDirectory(const char* root, const TraceDirectory& directory);

// Makes a file of zeros and returns its descriptor, or returns -1 and leaves none. Its space is reserved on file
// systems that write in place.
int makeZeroFile(int directory, const char* name, uint64_t bytes);

// Whether a first file can be made now.
bool canMakeFirstFile(int directory);

}  // namespace trc
