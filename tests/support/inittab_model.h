// A model of EtcInittab, for comparing it with the class: the whole file is a string, and each record its bytes.
#pragma once

#include <stddef.h>

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "line_model.h"
#include "osutils.h"

// Where the command begins in a record.
inline constexpr size_t kCommandOffset = 50;

// The piece from the first character of its entry, or empty.
inline std::string entryText(const std::string& piece) {
  const size_t begin = piece.find_first_not_of(kSpace);
  if (begin == std::string::npos || (kDigits + kLetters).find(piece[begin]) == std::string::npos) {
    return "";
  }
  return piece.substr(begin);
}

// Removes the first field from the text and returns it.
inline std::string takeField(std::string& text, size_t width) {
  const size_t length = std::min({text.find(':'), width, text.size()});
  const std::string field = text.substr(0, length);
  text.erase(0, length);
  if (!text.empty() && text[0] == ':') text.erase(0, 1);
  return field;
}

// The bytes of a record with these values, zero after each of them.
inline std::string modelRecord(std::string id, std::string runlevels, std::string action,
                               const std::string& process) {
  id.resize(10);
  runlevels.resize(10);
  action.resize(30);
  std::string command = upToNul(process).substr(0, 256);
  command.resize(sizeof(VRAOSUtils::InittabEntry::process));
  return id + runlevels + action + command;
}

inline std::vector<std::string> modelInittab(const std::string& contents) {
  std::vector<std::string> list;
  for (const std::string& piece : piecesOf(contents)) {
    std::string text = entryText(piece);
    if (text.empty()) continue;
    const std::string id = takeField(text, 10);
    const std::string runlevels = takeField(text, 10);
    const std::string action = takeField(text, 30);
    list.push_back(modelRecord(id, runlevels, action, text.substr(0, text.find('\n'))));
  }
  return list;
}

inline std::string modelWithoutEntry(const std::string& id, const std::string& contents) {
  std::string left;
  for (const std::string& piece : piecesOf(contents)) {
    const std::string text = entryText(piece);
    if (text.empty() || upToNul(text.substr(0, text.find(':'))) != id) left += piece;
  }
  return left;
}

// The file and an editor of it.
class InittabModel {
 public:
  explicit InittabModel(std::string contents) : contents_(std::move(contents)) {}

  const std::string& contents() const { return contents_; }
  const std::vector<std::string>& list() const { return list_; }

  // What other programs do to the file: they add text to it, or remove it.
  void write(const std::string& text) {
    contents_ += text;
    has_file_ = true;
  }
  void removeFile() {
    contents_.clear();
    has_file_ = false;
  }

  void forget() { list_.clear(); }
  int read() {
    list_ = modelInittab(contents_);
    return checkFile();
  }

  int add(const std::string& id, const std::string& runlevels, const std::string& action,
          const std::string& process) {
    if (has(id)) return OSUTILS_ALREADY_EXISTS;
    if (!has_file_) return checkFile();
    contents_ += id + ":" + runlevels + ":" + action + ":" + process + "\n";
    list_.insert(list_.begin(), modelRecord(id, runlevels, action, process));
    return OSUTILS_SUCCESS;
  }

  int remove(const std::string& id) {
    const auto found = find(id);
    if (found == list_.end()) return OSUTILS_NO_SUCH_OBJECT;
    if (!has_file_) return checkFile();
    contents_ = modelWithoutEntry(id, contents_);
    list_.erase(found);
    return OSUTILS_SUCCESS;
  }

  bool has(const std::string& id) const { return find(id) != list_.end(); }

  // The first record with this text in its command, or null.
  const std::string* withCommand(const std::string& text) const {
    for (const std::string& record : list_) {
      if (upToNul(record.substr(kCommandOffset)).find(text) != std::string::npos) return &record;
    }
    return nullptr;
  }

  std::string freeId(const std::string& prefix) const {
    for (const char suffix : std::string("0123456789abcdefghijklmnopqrstuvwxyz")) {
      if (!has(prefix + suffix)) return prefix + suffix;
    }
    return "(none)";
  }

 private:
  // As a string an id goes on to the first NUL of its record.
  std::vector<std::string>::const_iterator find(const std::string& id) const {
    return std::find_if(list_.begin(), list_.end(),
                        [&id](const std::string& record) { return upToNul(record) == id; });
  }

  int checkFile() const { return has_file_ ? OSUTILS_SUCCESS : OSUTILS_NO_SUCH_OBJECT; }

  std::string contents_;
  bool has_file_ = true;
  std::vector<std::string> list_;
};
