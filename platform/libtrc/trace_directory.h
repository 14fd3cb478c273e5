// The directory of one process's trace.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include "format.h"

namespace trc {

struct TraceDirectory {
  char name[128];  // below the root directory
  dev_t device;
  ino_t inode;
  Uuid uuid;
};

// The size of a stream's first file. Small, because many threads are short-lived.
constexpr uint64_t kFirstFileBytes = 4 << 10;

// Makes a new trace in `root`, and `root` itself if it does not exist. The trace gets its name when its metadata is
// complete and there is room for a first file. Not thread-safe.
bool makeTraceDirectory(const char* root, bool are_packets_numbered, TraceDirectory& out);

// Opens the directory again. Returns -1 if it is gone, or if another directory has its name. The descriptor is not
// kept open between files, because programs close descriptors that they do not know.
int openTraceDirectory(const char* root, const TraceDirectory& directory);

// Makes a file of zeros and returns its descriptor. Returns -1 and leaves no file if it cannot. On file systems that
// write in place, the file's space is then reserved.
int makeZeroFile(int directory, const char* name, uint64_t bytes);

// Makes a file of zeros and maps it. Returns null and leaves no file if it cannot.
char* makeMappedFile(int directory, const char* name, uint64_t bytes);

// Returns false if it cannot.
bool setFileSize(int directory, const char* name, uint64_t bytes);

// Returns whether a first file can be made now.
bool canMakeFirstFile(int directory);

}  // namespace trc
