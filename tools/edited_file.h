// What the commands that edit a line-based system file share.
#pragma once

#include <stdint.h>
#include <stdio.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "command.h"
#include "edit_lock.h"

struct CloseDeleter {
  void operator()(FILE* stream) const { (void)fclose(stream); }
};
using Stream = std::unique_ptr<FILE, CloseDeleter>;

Stream openToRead(const std::string& path);

// Which file the command works on, where its editor keeps a copy meanwhile, and how careful it is.
class EditedFile {
 public:
  // `family` is the one that the command belongs to.
  explicit EditedFile(const char* family) : family_(family) {}

  // Adds --file and --backup to the command.
  void addOptions(Tool& tool, Command& command, const char* usual_file);
  // Adds what only the commands that write the file have.
  void addEditOptions(Tool& tool, Command& command);
  void addRestoreOptions(Tool& tool, Command& command);
  // Points the editor's two class-wide paths at what the options say.
  void select(const char*& editors_file, const char*& editors_backup);

 private:
  friend class Edit;
  friend Answer restore(const EditedFile& options, bool dry_run);

  std::string restoreCommand() const;

  const char* family_;
  std::optional<std::string> file_;
  std::optional<std::string> backup_;
  std::string path_;  // what was selected
  std::string backup_path_;
  bool no_lock_ = false;
  bool discard_backup_ = false;
  bool yes_ = false;
  bool force_ = false;
};

// One edit of a file: the lock and the checks before it, and what has become of the file after it.
class Edit {
 public:
  // Takes the file's lock, which a dry run does without, and reads the file.
  Edit(const EditedFile& options, bool dry_run);
  ~Edit();
  Edit(const Edit&) = delete;
  Edit& operator=(const Edit&) = delete;

  // What is in the file before it is edited.
  const std::string& before() const { return before_; }

  // Makes sure that the edit can end well, as far as that can be known. Then, in a dry run, the answer
  // is the difference that it would make.
  std::optional<Answer> prepareToAppend(const std::string& line);
  std::optional<Answer> prepareToDelete(const std::string& wanted);

  // Looks at what the editor did, and fails with the state of the file and its copy, and the command that
  // puts them right, when it did not do it. `what` is what was wanted: "add "ssh" to FILE".
  // After an addition, `is_there` says whether the editor found it when it read the file again; a part
  // of the line is taken away.
  void finishAddition(int code, const std::string& line, bool is_there, const std::string& what);
  void finishDeletion(int code, const std::string& wanted, const std::string& what);

 private:
  void openToWrite(int flags);
  void requireFreeBackup();
  void requireRoomForCopy() const;
  void requireDescriptors() const;
  std::optional<Answer> answerOrDiscard(const std::string& wanted) const;
  bool putBack();

  const EditedFile& options_;
  const std::string& path_;
  const std::string& backup_;
  bool dry_run_;
  bool discard_ = false;
  int descriptor_ = -1;
  std::optional<EditLock> lock_;
  std::string before_;
};

// Puts the copy that a deletion left behind back into the file, unless all of it is there, and removes it.
// The copy stays whole until the file is.
Answer restore(const EditedFile& options, bool dry_run);

// Calls `visit` with each piece that the editors take for a line, its newline included.
void forEachLine(std::string_view text, const std::function<void(std::string_view line)>& visit);

// True when an appended line would be a line of its own.
bool isLastLineComplete(const std::string& text);

bool isAsciiLetter(char c);
bool isAsciiDigit(char c);
bool isAsciiControl(char c);
