// The lines of a file as the editors of the services file and the inittab file read them, for models of these editors.
#pragma once

#include <stddef.h>

#include <string>
#include <vector>

// The lines of a file as an editor reads them: 1,023 characters at most.
inline std::vector<std::string> piecesOf(const std::string& contents) {
  std::vector<std::string> pieces;
  bool complete = true;
  for (const char c : contents) {
    if (complete) pieces.emplace_back();
    pieces.back() += c;
    complete = c == '\n' || pieces.back().size() == 1023;
  }
  return pieces;
}

// The white space that an editor skips before an entry.
inline const std::string kSpace = " \t\n\v\f\r";
inline const std::string kDigits = "0123456789";
inline const std::string kLetters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";

inline std::string upToNul(const std::string& text) { return text.substr(0, text.find('\0')); }
