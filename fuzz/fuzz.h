// What the fuzz targets share.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

// The text with its unprintable bytes escaped.
inline std::string shown(std::string_view text) {
  std::string out = "\"";
  for (const char c : text) {
    if (c >= ' ' && c <= '~' && c != '"' && c != '\\') {
      out += c;
    } else {
      char escaped[5];
      snprintf(escaped, sizeof escaped, "\\x%02X", static_cast<unsigned>(static_cast<uint8_t>(c)));
      out += escaped;
    }
  }
  return out + "\"";
}

// Ends the program, as a sanitizer's report does.
[[noreturn]] inline void fail(const char* what, const std::string& ours,
                              const std::string& expected) {
  fprintf(stderr, "%s\n  ours:  %s\n  model: %s\n", what, ours.c_str(), expected.c_str());
  abort();
}

inline void expectSame(const char* what, std::string_view ours, std::string_view expected) {
  if (ours != expected) fail(what, shown(ours), shown(expected));
}

inline void expectSame(const char* what, long ours, long expected) {
  if (ours != expected) fail(what, std::to_string(ours), std::to_string(expected));
}

// Ends a target that cannot run.
[[noreturn]] inline void giveUp(const std::string& what) {
  fprintf(stderr, "%s: %s\n", what.c_str(), strerror(errno));
  abort();
}

// The parts of a text between separators: one part if there is none.
inline std::vector<std::string> partsOf(const std::string& text, char separator) {
  std::vector<std::string> parts;
  size_t begin = 0;
  for (size_t end = 0; end != std::string::npos; begin = end + 1) {
    end = text.find(separator, begin);
    parts.push_back(text.substr(begin, end - begin));
  }
  return parts;
}

// Separate the parts of an input that are not text.
constexpr char kRecordSeparator = '\x1E';
constexpr char kFieldSeparator = '\x1F';

// A folder for the files of a target.
class Folder {
 public:
  Folder() {
    const char* const parent = getenv("TMPDIR");
    path_ = std::string(parent != nullptr ? parent : "/tmp") + "/fuzz.XXXXXX";
    if (mkdtemp(path_.data()) == nullptr) giveUp(path_);
  }
  ~Folder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  Folder(const Folder&) = delete;
  Folder& operator=(const Folder&) = delete;

  std::string path(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Replaces what the file has, or adds to it (O_APPEND).
inline void writeTo(const std::string& path, std::string_view text, int mode = O_TRUNC) {
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | mode, 0644);
  if (file == -1 || write(file, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    giveUp(path);
  }
  close(file);
}

inline std::string contentsOf(const std::string& path) {
  struct stat status;
  const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (file == -1 || fstat(file, &status) != 0) giveUp(path);
  std::string text(static_cast<size_t>(status.st_size), '\0');
  if (read(file, text.data(), text.size()) != status.st_size) giveUp(path);
  close(file);
  return text;
}
