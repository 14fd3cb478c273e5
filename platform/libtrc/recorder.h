// The files of a trace that keeps the latest records (TRC_MODE=latest).
//
// Each live thread has an equal share of the process's bound. While it has less, it gets new files, and files are
// deleted for it where the bound is reached: those of ended threads first, then the oldest of the thread that has
// most. When it has its share, it writes into its oldest file again: the pages are in memory and mapped, so they are
// neither filled with zeros nor faulted in. The file that is written next is hidden one file earlier, so that
// readers have as long as the thread needs for a file to finish reading it.
//
// Readers list the names first and open them later, so a name must not disappear while a thread writes into its
// files again and again. A file has one of two names in turn; the other one is a link to the stream's blank file.
// A reader that opens a name where it has seen a packet before finds the same packet, or an empty one of the time of
// the newest packet that was hidden. The empty packet has the other one's size, and the blank file that of the files in
// use: readers keep the sizes that they saw, and some open a name anew for each packet.
//
//   in use   | opening packet | packet with records, unused space        |
//   blank    | opening packet, of both sizes [ an empty packet within ]  |
//
// The opening packets of a stream are equal: empty, with the number 0, and older than any record. From there to the
// oldest packet with records, readers count the packets and the records that are missing.
//
// The caller of each function holds the process lock.
#pragma once

#include <stdint.h>

#include "format.h"

namespace trc::recorder {

// The trace that the files are in.
struct Target {
  int directory;  // open; -1 when it is unavailable
  Uuid uuid;
  uint64_t max_bytes;
  uint64_t* used_bytes;
};

struct Request {
  uint64_t record_bytes;  // of the next record
  uint64_t time;
  uint64_t written;    // records in the stream's present file
  uint64_t discarded;  // records that the stream has not recorded
};

// A file for the records of a thread.
struct OpenFile {
  char* base;
  uint64_t bytes;
  Packet* packet;
  char* records;  // where the first record goes
};

enum class Result { kOpened, kTooLarge, kNoFile };

// A stream's number here; 0: none.
using StreamId = uint32_t;

// Forgets all streams of an earlier trace, or of the parent process. Their files stay; what is mapped of them is
// unmapped, apart from the files that threads are writing.
void forgetStreams();

// Returns 0 if there is no memory for it.
StreamId addStream(uint64_t instance, unsigned int tid, uint64_t begin, const Target& target);

// Opens the stream's next file. If the result is not kOpened, the present file stays open.
Result openNextFile(StreamId id, const Target& target, const Request& request, OpenFile& out);

// Called when the thread ends. Unmaps the stream's files, which stay until their space is needed.
void endStream(StreamId id, const Target& target);

}  // namespace trc::recorder
