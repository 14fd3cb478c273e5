// What the editors of line-based system files share: reading lines with a bound, appending one, and
// rewriting the file from a backup copy without some of its lines.
#pragma once

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>

#include <utility>

#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "resumed_stream.h"

namespace osutils {

// Reads a stream line by line. A line longer than 1023 characters comes in pieces of that size,
// each of them a line of its own. Reads whole blocks: nothing else may read the stream.
class LineReader {
 public:
  explicit LineReader(FILE* stream) : stream_(stream) {}

  // Reads the next line. Returns false at the end of the stream and after a read error.
  bool next();
  // The line, its newline included, with a NUL after it. It may contain more NULs.
  const char* text() const { return block_ + line_; }
  size_t length() const { return next_ - line_; }

 private:
  // Sets next_ to the end of the line. Returns false if more must be read to find it.
  bool findEnd();
  void readOn();

  static constexpr size_t kLongestLine = 1023;
  // Small, because it is on the caller's stack; the C library's buffer keeps system calls few.
  static constexpr size_t kBlockBytes = size_t{2} * 1024;

  FILE* stream_;
  size_t line_ = 0;  // where the line begins in the block
  size_t next_ = 0;  // where it ends and the next one begins
  size_t end_ = 0;   // where the text in the block ends
  bool at_end_ = false;
  char first_ = '\0';  // of the next line: the NUL of this line replaces it in the block
  char block_[kBlockBytes + 1];
};

enum class Append { kDone, kCannotOpen, kCannotFormat };

// Appends one line to the file; a failed write is not reported. `format_line` makes the line with
// vra_asprintf and returns its result; it reports a failure itself, while the file is still open.
// After kCannotOpen, errno has the reason.
template <typename FormatLine>
Append appendLine(const char* path, FormatLine format_line) {
  const OwnedStream stream = openStream(path, "a");
  if (!stream) return Append::kCannotOpen;
  char* line = nullptr;
  if (format_line(&line) == -1) return Append::kCannotFormat;
  const OwnedString owner(line);
  (void)fputs(line, stream.get());
  return Append::kDone;
}

// Copies the file to its backup and forces that to the disk. Returns false also if the copy is
// shorter than the file, as on a full disk, or if both are the same file: the file must not be
// rewritten from such a copy. A copy that cannot be forced to the disk is removed.
bool copyToBackup(const char* path, const char* backup);

// Forces what was written to the disk and closes the stream. Returns false if either fails.
bool closeOnDisk(OwnedStream stream);

// Rewrites the file from its backup without the lines for which `is_dropped(text)` is true, and
// removes the backup. Every other line is written exactly as it was read. Returns false if
//   - one of the two files cannot be opened, after it has called `report_open` with the error
//     number and then removed the backup; the file is empty if only the backup cannot be opened;
//   - the backup cannot be read to its end, or the file cannot be written or forced to the disk,
//     after it has called `report_incomplete`; the backup is left.
template <typename IsDropped, typename ReportOpen, typename ReportIncomplete>
bool rewriteFromBackup(const char* path, const char* backup, IsDropped is_dropped,
                       ReportOpen report_open, ReportIncomplete report_incomplete) {
  char* const backup_name = const_cast<char*>(backup);  // deleteFile only reads it
  OwnedStream from = openStream(backup, "r");
  int error = errno;
  // sic: opened, and so emptied, even if the first open fails.
  OwnedStream to = openStream(path, "w");
  if (!to) error = errno;
  if (!from || !to) {
    report_open(error);
    (void)deleteFile(backup_name);
    return false;
  }

  bool complete = true;
  for (LineReader reader(from.get()); reader.next();) {
    if (is_dropped(reader.text())) continue;
    complete = fwrite(reader.text(), 1, reader.length(), to.get()) == reader.length() && complete;
  }
  complete = ferror(from.get()) == 0 && complete;
  from.reset();
  // The lines that were not written are only in the backup.
  if (!closeOnDisk(std::move(to)) || !complete) {
    report_incomplete();
    return false;
  }
  (void)deleteFile(backup_name);
  return true;
}

}  // namespace osutils
