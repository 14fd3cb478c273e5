// How the edits of a line-based system file may end: the same for both editors.
#pragma once

#include <string>
#include <vector>

#include "scenario.h"

namespace scenarios {

// A file, its backup (NAME.save), and an editor's list as text.
struct EditedFile {
  std::string name;
  std::string contents;
  std::string added;    // the contents after an addition
  std::string deleted;  // and after a deletion
  std::string list;
  std::string list_begun;  // what comes before the comments
  std::string list_added;
  std::string list_deleted;

  void make() const { makeFile(name, contents); }
  // "644 before, no backup": what the file and the backup hold.
  std::string shown() const;
  // The result of a call with this code.
  std::string result(int code) const { return std::to_string(code) + " " + list; }

  // Each of these edits first reads the file, and ends with "not read: " if that fails or if the list is
  // not complete.
  std::vector<End> readEnds() const;
  std::vector<End> addEnds() const;
  std::vector<End> deleteEnds() const;
  // There is a backup already, with mode 0600 and this text.
  std::vector<End> deleteEndsWithBackup() const;
  static constexpr const char* kEarlierBackup = "earlier";
  // Those of a call that only needs the list, and leaves this state in any case.
  std::vector<End> queryEnds(const std::string& result, const std::string& state = "") const;
};

}  // namespace scenarios
