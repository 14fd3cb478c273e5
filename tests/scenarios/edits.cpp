#include "edits.h"

#include <utility>

namespace scenarios {
namespace {

using Ends = std::vector<End>;

void append(Ends& ends, Ends more) {
  for (End& end : more) ends.push_back(std::move(end));
}

// Whether `part` is `whole` without some of its lines; the last one may be cut.
bool isPart(const std::string& part, const std::string& whole) {
  size_t at = 0;
  for (size_t line = 0; line < part.size();) {
    const size_t end = part.find('\n', line);
    const bool is_cut = end == std::string::npos;
    const std::string text = part.substr(line, is_cut ? std::string::npos : end + 1 - line);
    while (at < whole.size() && whole.compare(at, text.size(), text) != 0) {
      at = whole.find('\n', at) + 1;
    }
    if (at >= whole.size()) return false;
    at += text.size();
    line += text.size();
    if (is_cut) return true;
  }
  return true;
}

std::string named(const std::string& shown, const EditedFile& file) {
  const size_t blank = shown.find(' ');
  if (blank == std::string::npos) return shown;
  const std::string text = shown.substr(blank + 1);
  const std::string mode = shown.substr(0, blank + 1);
  if (text.empty()) return mode + "empty";
  if (text == file.contents) return mode + "before";
  if (text == file.added) return mode + "added";
  if (text == file.deleted) return mode + "deleted";
  if (isPart(text, file.deleted)) return mode + "part";
  return file.contents.starts_with(text) ? mode + "beginning" : shown;
}

// The results of reading the file, after `prefix`.
Ends unread(const EditedFile& file, const std::string& prefix, const Expected& state) {
  return {// A read error counts as the end of the file.
          {kRead, prefix + "0 ()", state},    {kRead, prefix + "0 " + file.list_begun, state},
          {kMemory, prefix + "89 ()", state},  // without a copy of the path
          {kMemory, prefix + "90 ()", state}, {kStatus, prefix + "32 ()", state},
          {kStatus, prefix + "50 ()", state}, {kOpen, prefix + "53 ()", state}};
}

}  // namespace

std::string EditedFile::shown() const {
  const std::string backup = shownFile(name + ".save");
  return named(shownFile(name), *this) + ", " +
         (backup == "missing" ? "no backup" : "backup " + named(backup, *this));
}

Ends EditedFile::readEnds() const {
  Ends ends = {{kNothing, result(0), "644 before, no backup"}};
  append(ends, unread(*this, "", "644 before, no backup"));
  return ends;
}

Ends EditedFile::addEnds() const {
  const std::string unchanged = "644 before, no backup";
  Ends ends = {{kNothing, "0 " + list_added, "644 added, no backup"},
               {kStatus, result(32), unchanged},
               {kStatus | kOpen, result(50), unchanged},
               {kMemory | kPrint, result(90), unchanged},
               // A failed write is not reported.
               {kWrite, "0 " + list_added, unchanged}};
  append(ends, unread(*this, "not read: ", unchanged));
  return ends;
}

namespace {

// `umask` is that after the copy was made, and `mode` that of the copy.
Ends deletionEnds(const EditedFile& file, const std::string& umask, const std::string& mode) {
  const std::string failed = file.result(50) + umask;
  const std::string backup = ", backup " + mode + " ";
  return {
      // The copy was removed, or the file could not be opened.
      {kOpen | kSync, failed, "644 before, no backup"},
      // No or not all of the file was copied.
      {kWrite, failed, "644 before" + backup + "empty"},
      {kWrite, failed, "644 before" + backup + "part"},
      {kWrite, failed, "644 before" + backup + "beginning"},
      // The copy could not be examined, or not be removed.
      {kStatus | kDirectory, failed, "644 before" + backup + "before"},
      // Only the copy could not be opened.
      {kOpen, failed, "644 empty, no backup"},
      {kRead | kWrite, failed, "644 empty" + backup + "before"},
      {kRead | kWrite, failed, "644 part" + backup + "before"},
      {kWrite | kSync | kClose, failed, "644 deleted" + backup + "before"},
      {kDirectory, "0 " + file.list_deleted + umask, "644 deleted" + backup + "before"},
  };
}

}  // namespace

Ends EditedFile::deleteEnds() const {
  const std::string unchanged = "644 before, no backup";
  Ends ends = {
      {kNothing, "0 " + list_deleted + ", umask 26", "644 deleted, no backup"},
      {kStatus, result(32) + ", umask 22", unchanged},
      {kStatus, result(50) + ", umask 22", unchanged},
      {kLookup | kLock | kOwner, result(50) + ", umask 26", unchanged},
      // The copy was made, but not written.
      {kOpen | kClose | kDirectory, result(50) + ", umask 26", "644 before, backup 640 empty"}};
  append(ends, deletionEnds(*this, ", umask 26", "640"));
  append(ends, unread(*this, "not read: ", unchanged));
  return ends;
}

Ends EditedFile::deleteEndsWithBackup() const {
  const std::string unchanged = "644 before, backup 600 earlier";
  Ends ends = {{kNothing, "0 " + list_deleted + ", umask 22", "644 deleted, no backup"},
               {kStatus, result(32) + ", umask 22", unchanged},
               {kStatus | kOpen, result(50) + ", umask 22", unchanged},
               // The old backup was taken for missing, and so made anew.
               {kStatus, "0 " + list_deleted + ", umask 26", "644 deleted, no backup"},
               {kStatus, result(50) + ", umask 26", "644 before, backup 640 before"},
               {kStatus, result(50) + ", umask 26", unchanged}};
  append(ends, deletionEnds(*this, ", umask 22", "600"));
  append(ends, unread(*this, "not read: ", unchanged));
  return ends;
}

Ends EditedFile::queryEnds(const std::string& result, const std::string& state) const {
  Ends ends = {{kNothing, result, state}};
  append(ends, unread(*this, "not read: ", state));
  return ends;
}

}  // namespace scenarios
