// What the commands that edit a line-based system file share.
#pragma once

#include <stdio.h>

#include <memory>
#include <string>

#include "command.h"

struct CloseDeleter {
  void operator()(FILE* stream) const { (void)fclose(stream); }
};
using Stream = std::unique_ptr<FILE, CloseDeleter>;

Stream openToRead(const std::string& path);

// True when an appended line would be a line of its own.
bool isLastLineComplete(const std::string& path);

// Which file the command works on, and where its editor keeps a copy meanwhile.
class EditedFile {
 public:
  // Adds --file and --backup to the command.
  void addOptions(Tool& tool, Command& command, const char* usual_file);
  // Points the editor's two class-wide paths at what the options say.
  void select(const char*& editors_file, const char*& editors_backup);

 private:
  std::optional<std::string> file_;
  std::optional<std::string> backup_;
};

// Where a copy was left when a deletion failed: "; there is a copy at PATH", or nothing.
std::string copyLeftAt(const std::string& backup, const std::string& path);

bool isAsciiLetter(char c);
bool isAsciiDigit(char c);
bool isAsciiControl(char c);
