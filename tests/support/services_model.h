// A model of EtcServices, for comparing it with the class: the whole file is a string, and the list a vector.
#pragma once

#include <limits.h>
#include <stddef.h>

#include <algorithm>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "line_model.h"
#include "osutils.h"

struct Service {
  std::string name;
  int port;
  bool operator==(const Service&) const = default;
};

// Removes the leading characters that are in `set`, or those that are not, and returns them.
inline std::string take(std::string& text, const std::string& set, bool belongs) {
  size_t length = 0;
  while (length < text.size() && (set.find(text[length]) != std::string::npos) == belongs) ++length;
  const std::string taken = text.substr(0, length);
  text.erase(0, length);
  return taken;
}

// The first word of a piece if it begins with a letter, else empty. `rest` is the text after the word.
inline std::string serviceWord(const std::string& piece, std::string& rest) {
  rest = upToNul(piece);
  take(rest, kSpace, true);
  const std::string word = take(rest, kSpace, false);
  return !word.empty() && kLetters.find(word[0]) != std::string::npos ? word : "";
}

inline std::vector<Service> modelServices(const std::string& contents) {
  std::vector<Service> list;
  for (const std::string& piece : piecesOf(contents)) {
    std::string rest;
    const std::string word = serviceWord(piece, rest);
    if (word.empty()) continue;
    take(rest, kSpace, true);
    const std::string digits = take(rest, kDigits, true);
    if (digits.empty()) continue;
    long port = 0;
    for (const char digit : digits) {
      if (__builtin_mul_overflow(port, 10, &port) ||
          __builtin_add_overflow(port, digit - '0', &port)) {
        port = LONG_MAX;
        break;
      }
    }
    list.push_back({word.substr(0, 90), static_cast<int>(port)});
  }
  return list;
}

inline std::string modelWithoutService(const std::string& name, const std::string& contents) {
  std::string left;
  for (const std::string& piece : piecesOf(contents)) {
    std::string rest;
    const std::string word = serviceWord(piece, rest);
    if (word.empty() || word != name) left += piece;
  }
  return left;
}

// The file and an editor of it.
class ServicesModel {
 public:
  explicit ServicesModel(std::string contents) : contents_(std::move(contents)) {}

  const std::string& contents() const { return contents_; }
  const std::vector<Service>& list() const { return list_; }

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
    list_ = modelServices(contents_);
    return checkFile();
  }

  int add(const std::string& name, int port) {
    if (has(name)) return OSUTILS_ALREADY_EXISTS;
    if (!isPortFree(port)) return OSUTILS_UNAVAILABLE;
    if (!has_file_) return checkFile();
    contents_ += name + "\t" + std::to_string(port) + "/tcp\n";
    list_.insert(list_.begin(), {name.substr(0, 90), port});
    return OSUTILS_SUCCESS;
  }

  int remove(const std::string& name) {
    const auto found = find(name);
    if (found == list_.end()) return OSUTILS_NO_SUCH_OBJECT;
    if (!has_file_) return checkFile();
    contents_ = modelWithoutService(name, contents_);
    list_.erase(found);
    return OSUTILS_SUCCESS;
  }

  bool has(const std::string& name) const { return find(name) != list_.end(); }

  int portOf(const std::string& name) const {
    const auto found = find(name);
    return found == list_.end() ? -1 : found->port;
  }

  bool isPortFree(int port) const {
    return 1 <= port && port <= 400000 &&
           std::none_of(list_.begin(), list_.end(),
                        [port](const Service& service) { return service.port == port; });
  }

  int freePort(int start) const {
    std::set<int> used;
    for (const Service& service : list_) used.insert(service.port);
    for (int port = std::max(start, 1); port <= 400000; ++port) {
      if (!used.contains(port)) return port;
    }
    return -1;
  }

 private:
  std::vector<Service>::const_iterator find(const std::string& name) const {
    return std::find_if(list_.begin(), list_.end(),
                        [&name](const Service& service) { return service.name == name; });
  }

  int checkFile() const { return has_file_ ? OSUTILS_SUCCESS : OSUTILS_NO_SUCH_OBJECT; }

  std::string contents_;
  bool has_file_ = true;
  std::vector<Service> list_;
};
