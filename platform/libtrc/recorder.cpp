#include "recorder.h"

#include <fcntl.h>
#include <stddef.h>
#include <stdio.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <bit>
#include <iterator>
#include <new>

#include "descriptors.h"
#include "trace_directory.h"

namespace trc::recorder {
namespace {

constexpr uint64_t kPageBytes = 4096;
// A thread alone loses at most two files of its share to the one that it fills and the one that is hidden.
constexpr uint64_t kFilesOfOneThread = 16;
constexpr uint64_t kFilesOfEachThread = 8;
// The first files of a stream are smaller, because many threads are short-lived.
constexpr uint64_t kFirstSizes[] = {kFirstFileBytes, 64 << 10, 256 << 10, 1 << 20};
constexpr uint64_t kMaxFileBytes = 16 << 20;  // filled with zeros at once
constexpr uint64_t kMappedBlankBytes = 2 * sizeof(NumberedPacket);
// A process may have 65,530 mappings.
constexpr uint32_t kMaxFiles = 16 << 10;

using FileId = uint32_t;  // 0: none

struct File {
  char* base;  // null when it is not mapped
  uint64_t bytes;
  uint64_t records;  // 0 while it is open
  uint32_t slot;     // its names are those with twice this number and one more
  bool is_second;    // has the second name now
  bool has_both;     // the other name is the blank file's
  bool is_open;      // a thread writes into it
  FileId older;
  FileId newer;
};

struct Stream {
  uint64_t instance;
  uint64_t begin;  // before the first record
  uint64_t overwritten;
  uint64_t held_bytes;
  uint64_t packets;  // with records
  unsigned int tid;
  uint32_t slots;
  uint32_t visible;  // files
  FileId oldest;
  FileId newest;  // the open one, unless the thread has ended
  FileId spare;
  char* blank;  // null when it is not mapped
  bool has_blank;
  uint64_t blank_bytes;  // the file's size
  StreamId previous;
  StreamId next;
};

struct Streams {
  StreamId first;
  StreamId last;
  uint32_t count;
};

struct Tables {
  Streams live;
  Streams ended;  // in the order of their ends
  uint32_t files_used;
  uint32_t streams_used;
  FileId free_file;
  StreamId free_stream;
  File files[kMaxFiles];
  Stream streams[kMaxFiles];
};

// Not wiped in a child, so that it can unmap its parent's files.
Tables* tables = nullptr;

// ---- Lists ----

void append(Streams& list, StreamId id) {
  Stream& s = tables->streams[id];
  s.previous = list.last;
  s.next = 0;
  (list.last != 0 ? tables->streams[list.last].next : list.first) = id;
  list.last = id;
  ++list.count;
}

void remove(Streams& list, StreamId id) {
  const Stream& s = tables->streams[id];
  (s.previous != 0 ? tables->streams[s.previous].next : list.first) = s.next;
  (s.next != 0 ? tables->streams[s.next].previous : list.last) = s.previous;
  --list.count;
}

void appendFile(Stream& s, FileId id) {
  File& file = tables->files[id];
  file.older = s.newest;
  file.newer = 0;
  (s.newest != 0 ? tables->files[s.newest].newer : s.oldest) = id;
  s.newest = id;
  ++s.visible;
}

FileId takeOldest(Stream& s) {
  const FileId id = s.oldest;
  s.oldest = tables->files[id].newer;
  (s.oldest != 0 ? tables->files[s.oldest].older : s.newest) = 0;
  --s.visible;
  return id;
}

bool hasFreeFile() { return tables->free_file != 0 || tables->files_used + 1 < kMaxFiles; }

FileId allocateFile() {
  FileId id = tables->free_file;
  if (id != 0) {
    tables->free_file = tables->files[id].newer;
  } else {
    id = ++tables->files_used;
  }
  tables->files[id] = File{};
  return id;
}

void unmap(File& file) {
  char* const base = file.base;
  file.base = nullptr;  // first, so that a child that is forked now does not unmap it
  if (base != nullptr) (void)munmap(base, file.bytes);
}

void releaseFile(FileId id) {
  unmap(tables->files[id]);
  tables->files[id].newer = tables->free_file;
  tables->free_file = id;
}

// ---- Names ----

struct Name {
  char text[80];
};

Name nameOf(const Stream& s, uint64_t number) {
  Name name;
  (void)snprintf(name.text, sizeof name.text, "stream-%u-%llu-%llu", s.tid,
                 static_cast<unsigned long long>(s.instance),
                 static_cast<unsigned long long>(number));
  return name;
}

Name nameOf(const Stream& s, const File& file) {
  return nameOf(s, file.slot * uint64_t{2} + (file.is_second ? 1 : 0));
}

Name hiddenName(const Stream& s, const char* what) {
  Name name;
  (void)snprintf(name.text, sizeof name.text, ".%s-%u-%llu", what, s.tid,
                 static_cast<unsigned long long>(s.instance));
  return name;
}
Name spareName(const Stream& s) { return hiddenName(s, "spare"); }
Name blankName(const Stream& s) { return hiddenName(s, "blank"); }

// ---- Packets ----

Packet* packetOf(const File& file) {
  return reinterpret_cast<Packet*>(file.base + sizeof(NumberedPacket));
}

void makePacket(char* at, const Stream& s, const Target& target, uint64_t bytes, uint64_t begin,
                uint64_t discarded, uint64_t number) {
  constexpr uint64_t kBits = 8;
  (void)new (at)
      NumberedPacket{{kPacketMagic, target.uuid, 0, s.instance, sizeof(NumberedPacket) * kBits,
                      bytes * kBits, begin, begin, discarded, s.tid},
                     number};
}

// Adds to the file's number of records that are missing.
void addMissing(const Stream& s, const File& file, const Target& target, uint64_t records) {
  if (file.base != nullptr) {
    const std::atomic_ref<uint64_t> missing(packetOf(file)->events_discarded);
    missing.fetch_add(records, std::memory_order_release);
    return;
  }
  const int fd =
      openAboveStandardStreams(target.directory, nameOf(s, file).text, O_RDWR | O_NOFOLLOW);
  if (fd == -1) return;
  constexpr off_t kPlace = sizeof(NumberedPacket) + offsetof(Packet, events_discarded);
  uint64_t missing;
  if (pread(fd, &missing, sizeof missing, kPlace) == sizeof missing) {
    missing += records;
    (void)!pwrite(fd, &missing, sizeof missing, kPlace);
  }
  (void)close(fd);
}

// Tells the readers of the stream's files that `records` before them are missing. From the newest file on, because
// readers expect that the numbers grow.
void addOverwritten(Stream& s, const Target& target, uint64_t records) {
  s.overwritten += records;
  for (FileId id = s.newest; id != 0; id = tables->files[id].older) {
    addMissing(s, tables->files[id], target, records);
  }
}

// ---- Making room ----

void dropSpare(Stream& s, const Target& target) {
  if (s.spare == 0) return;
  (void)unlinkat(target.directory, spareName(s).text, 0);
  s.held_bytes -= tables->files[s.spare].bytes;
  *target.used_bytes -= tables->files[s.spare].bytes;
  releaseFile(s.spare);
  s.spare = 0;
}

// Deletes a file that is no longer among those of its stream.
void deleteFile(Stream& s, FileId id, const Target& target) {
  File& file = tables->files[id];
  (void)unlinkat(target.directory, nameOf(s, file).text, 0);
  if (file.has_both) {
    file.is_second = !file.is_second;
    (void)unlinkat(target.directory, nameOf(s, file).text, 0);
  }
  s.held_bytes -= file.bytes;
  *target.used_bytes -= file.bytes;
  releaseFile(id);
}

void dropOldest(Stream& s, const Target& target) {
  const FileId id = takeOldest(s);
  addOverwritten(s, target, tables->files[id].records);
  deleteFile(s, id, target);
}

void unmapBlank(Stream& s) {
  char* const blank = s.blank;
  s.blank = nullptr;
  if (blank != nullptr) (void)munmap(blank, kMappedBlankBytes);
}

void dropBlank(Stream& s, const Target& target) {
  if (!s.has_blank) return;
  unmapBlank(s);
  (void)unlinkat(target.directory, blankName(s).text, 0);
  s.has_blank = false;
  s.held_bytes -= kPageBytes;
  *target.used_bytes -= kPageBytes;
}

// Deletes the oldest file of the thread that ended first. Returns false if there is none.
bool dropEnded(const Target& target) {
  const StreamId id = tables->ended.first;
  if (id == 0) return false;
  Stream& s = tables->streams[id];
  if (s.visible != 0) dropOldest(s, target);
  if (s.visible != 0) return true;
  dropBlank(s, target);
  remove(tables->ended, id);
  s.next = tables->free_stream;
  tables->free_stream = id;
  return true;
}

// Deletes a file of the live thread that has most, if that is more than `least` and not only its open file.
bool dropOfRichest(const Stream& not_this, const Target& target, uint64_t least) {
  Stream* richest = nullptr;
  uint64_t most = least;
  for (StreamId id = tables->live.first; id != 0; id = tables->streams[id].next) {
    Stream& s = tables->streams[id];
    if (&s == &not_this || s.held_bytes <= most || (s.visible < 2 && s.spare == 0)) continue;
    richest = &s;
    most = s.held_bytes;
  }
  if (richest == nullptr) return false;
  if (richest->visible >= 2) {
    dropOldest(*richest, target);
  } else {
    dropSpare(*richest, target);
  }
  return true;
}

bool makeRoom(const Stream& s, const Target& target, uint64_t bytes, uint64_t share) {
  while (*target.used_bytes + bytes > target.max_bytes || !hasFreeFile()) {
    if (dropEnded(target) || dropOfRichest(s, target, share)) continue;
    // A thread with no more than its open file cannot use an older one.
    if (s.visible >= 2) return false;
    if (dropOfRichest(s, target, 0)) continue;
    // If the bound has become smaller than the open file, that is deleted when the next one is full.
    return s.held_bytes > target.max_bytes && hasFreeFile();
  }
  return true;
}

// ---- Getting a file ----

FileId makeFile(Stream& s, const Target& target, uint64_t bytes, uint64_t share) {
  if (!makeRoom(s, target, bytes, share)) return 0;
  char* const base = makeMappedFile(target.directory, spareName(s).text, bytes);
  if (base == nullptr) return 0;
  const FileId id = allocateFile();
  tables->files[id].base = base;
  tables->files[id].bytes = bytes;
  s.held_bytes += bytes;
  *target.used_bytes += bytes;
  return id;
}

// Keeps a page for the blank file.
bool hasRoomInShare(const Stream& s, uint64_t bytes, uint64_t share) {
  return s.held_bytes + bytes + (s.has_blank ? 0 : kPageBytes) <= share;
}

// Returns a file with the spare file's name: the spare file itself, or a new one, for which the stream's oldest files
// are deleted as far as needed.
FileId getFile(Stream& s, const Target& target, uint64_t needed, uint64_t usual, uint64_t share) {
  uint64_t bytes = std::max(needed, usual);
  if (s.spare != 0) {
    const uint64_t spare_bytes = tables->files[s.spare].bytes;
    if (spare_bytes >= needed && spare_bytes >= usual / 2 && spare_bytes <= 2 * bytes) {
      const FileId id = s.spare;
      s.spare = 0;
      return id;
    }
    dropSpare(s, target);
  }
  while (true) {
    const bool is_within = hasRoomInShare(s, bytes, share) || s.visible < 2;
    if (is_within) {
      const FileId id = makeFile(s, target, bytes, share);
      if (id != 0) return id;
      // Without space on the disk, a file that is deleted makes room for one of its size.
      const uint64_t smaller = s.visible < 2 ? needed : tables->files[s.oldest].bytes;
      if (s.visible < 2 && bytes == needed) return 0;
      bytes = std::max(needed, smaller);
    }
    if (s.visible >= 2) dropOldest(s, target);
  }
}

Packet& emptyPacketOf(const Stream& s) {
  return reinterpret_cast<NumberedPacket*>(s.blank)[1].packet;
}

bool makeBlank(Stream& s, const Target& target, uint64_t share) {
  if (s.has_blank) return true;
  if (!makeRoom(s, target, kPageBytes, share)) return false;
  s.blank = makeMappedFile(target.directory, blankName(s).text, kMappedBlankBytes);
  if (s.blank == nullptr) return false;
  for (const uint64_t at : {uint64_t{0}, uint64_t{sizeof(NumberedPacket)}}) {
    makePacket(s.blank + at, s, target, sizeof(NumberedPacket), s.begin, 0, 0);
  }
  s.has_blank = true;
  s.blank_bytes = kMappedBlankBytes;
  s.held_bytes += kPageBytes;
  *target.used_bytes += kPageBytes;
  return true;
}

// Gives the blank file a size. Nearly all of it is a hole.
bool resizeBlank(Stream& s, const Target& target, uint64_t bytes) {
  if (s.blank_bytes == bytes) return true;
  const bool is_resized = setFileSize(target.directory, blankName(s).text, bytes);
  if (is_resized) {
    publish(reinterpret_cast<Packet*>(s.blank)->packet_size, bytes * 8);
    publish(emptyPacketOf(s).packet_size, (bytes - sizeof(NumberedPacket)) * 8);
    s.blank_bytes = bytes;
  }
  return is_resized;
}

// Hides a file, whose name becomes one of the blank file. Returns false if it cannot.
bool hide(const Stream& s, const File& file, const Target& target) {
  // The empty packet takes the place of the hidden one, and of those that were hidden before. The end comes first,
  // because readers read it last.
  Packet& blank = emptyPacketOf(s);
  const Packet& hidden = *packetOf(file);
  publish(blank.timestamp_end, hidden.timestamp_begin);
  publish(blank.timestamp_begin, hidden.timestamp_begin);
  publish(blank.events_discarded, hidden.events_discarded + file.records);
  const Name spare = spareName(s);
  if (linkat(target.directory, blankName(s).text, target.directory, spare.text, 0) != 0)
    return false;
  if (renameat2(target.directory, spare.text, target.directory, nameOf(s, file).text,
                RENAME_EXCHANGE) == 0) {
    return true;
  }
  (void)unlinkat(target.directory, spare.text, 0);
  return false;
}

}  // namespace

void forgetStreams() {
  if (tables == nullptr) return;
  for (FileId id = 1; id <= tables->files_used; ++id) {
    if (!tables->files[id].is_open) unmap(tables->files[id]);
  }
  for (StreamId id = 1; id <= tables->streams_used; ++id) unmapBlank(tables->streams[id]);
  tables->live = tables->ended = Streams{};
  tables->files_used = tables->streams_used = 0;
  tables->free_file = tables->free_stream = 0;
}

StreamId addStream(uint64_t instance, unsigned int tid, uint64_t begin, const Target& target) {
  if (tables == nullptr) {
    void* const memory = mmap(nullptr, sizeof(Tables), PROT_READ | PROT_WRITE,
                              MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) return 0;
    tables = static_cast<Tables*>(memory);
  }
  while (tables->free_stream == 0 && tables->streams_used + 1 == kMaxFiles) {
    if (!dropEnded(target)) return 0;
  }
  StreamId id = tables->free_stream;
  if (id != 0) {
    tables->free_stream = tables->streams[id].next;
  } else {
    id = ++tables->streams_used;
  }
  tables->streams[id] = Stream{};
  tables->streams[id].instance = instance;
  tables->streams[id].tid = tid;
  tables->streams[id].begin = begin;
  append(tables->live, id);
  return id;
}

Result openNextFile(StreamId id, const Target& target, const Request& request, OpenFile& out) {
  Stream& s = tables->streams[id];
  const bool is_alone = tables->live.count == 1;
  const uint64_t share = target.max_bytes / tables->live.count;
  const uint64_t needed = roundUp(2 * sizeof(NumberedPacket) + request.record_bytes, kPageBytes);
  if (needed > std::max(kPageBytes, share / 2)) return Result::kTooLarge;
  if (s.newest != 0) tables->files[s.newest].records = request.written;

  const uint64_t of_share = share / (is_alone ? kFilesOfOneThread : kFilesOfEachThread);
  // A power of two, so that the size seldom changes when threads begin and end.
  uint64_t usual = std::clamp(std::bit_floor(of_share), kPageBytes, kMaxFileBytes);
  if (s.packets < std::size(kFirstSizes)) usual = std::min(usual, kFirstSizes[s.packets]);

  while (s.held_bytes > share && s.visible > 2) dropOldest(s, target);
  const FileId taken = getFile(s, target, needed, usual, share);
  if (taken == 0) return Result::kNoFile;
  File& file = tables->files[taken];

  FileId hidden = 0;
  if (!hasRoomInShare(s, usual, share) && s.visible >= 2 &&
      tables->files[s.oldest].bytes == file.bytes && makeBlank(s, target, share) &&
      resizeBlank(s, target, file.bytes)) {
    hidden = takeOldest(s);
    addOverwritten(s, target, tables->files[hidden].records);
    file.slot = tables->files[hidden].slot;
    file.is_second = !tables->files[hidden].is_second;
    file.has_both = tables->files[hidden].has_both = true;
  } else {
    file.slot = s.slots;
    file.is_second = file.has_both = false;
  }
  makePacket(file.base, s, target, sizeof(NumberedPacket), s.begin, 0, 0);
  makePacket(file.base + sizeof(NumberedPacket), s, target, file.bytes - sizeof(NumberedPacket),
             request.time, request.discarded + s.overwritten, s.packets + 1);
  const bool is_named =
      renameat(target.directory, spareName(s).text, target.directory, nameOf(s, file).text) == 0;
  if (hidden != 0) {
    if (is_named && hide(s, tables->files[hidden], target)) {
      s.spare = hidden;
    } else {
      if (is_named) file.has_both = tables->files[hidden].has_both = false;
      deleteFile(s, hidden, target);
    }
  }
  if (!is_named) {
    s.spare = taken;
    dropSpare(s, target);
    return Result::kNoFile;
  }
  if (hidden == 0) ++s.slots;
  if (s.newest != 0) tables->files[s.newest].is_open = false;
  file.is_open = true;
  file.records = 0;
  appendFile(s, taken);
  ++s.packets;
  out = {file.base, file.bytes, packetOf(file), file.base + 2 * sizeof(NumberedPacket)};
  return Result::kOpened;
}

void endStream(StreamId id, const Target& target) {
  Stream& s = tables->streams[id];
  dropSpare(s, target);
  unmapBlank(s);
  for (FileId file = s.oldest; file != 0; file = tables->files[file].newer) {
    tables->files[file].is_open = false;
    unmap(tables->files[file]);
  }
  remove(tables->live, id);
  append(tables->ended, id);
}

}  // namespace trc::recorder
