#include "edited_file.h"

#include <errno.h>
#include <string.h>

bool isAsciiLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
bool isAsciiDigit(char c) { return c >= '0' && c <= '9'; }
bool isAsciiControl(char c) { return static_cast<unsigned char>(c) < ' ' || c == 127; }

Stream openToRead(const std::string& path) {
  Stream stream(fopen(path.c_str(), "re"));
  if (!stream) throw Failure(OSUTILS_OPERATIONS_ERROR, path + ": " + strerror(errno));
  return stream;
}

bool isLastLineComplete(const std::string& path) {
  const Stream stream = openToRead(path);
  return fseek(stream.get(), -1, SEEK_END) != 0 || fgetc(stream.get()) == '\n';  // or it is empty
}

void EditedFile::addOptions(Tool& tool, Command& command, const char* usual_file) {
  tool.option(command, "--file", "FILE", file_,
              std::string("The file to use instead of ") + usual_file);
  tool.option(command, "--backup", "FILE", backup_,
              "Where delete keeps a copy while it works, instead of FILE.vrasave");
}

void EditedFile::select(const char*& editors_file, const char*& editors_backup) {
  if (file_) {
    editors_file = file_->c_str();
    if (!backup_) backup_ = *file_ + ".vrasave";
  }
  if (backup_) editors_backup = backup_->c_str();
}

std::string copyLeftAt(const std::string& backup, const std::string& path) {
  std::string name = backup;
  return backup != path && isFile(name.data()) ? "; there is a copy at " + backup : "";
}
