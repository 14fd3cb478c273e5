// What the commands that edit a line-based system file share.
#pragma once

#include <stdint.h>
#include <stdio.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "command.h"
#include "edit_lock.h"

struct CloseDeleter {
  void operator()(FILE* stream) const { (void)fclose(stream); }
};
using Stream = std::unique_ptr<FILE, CloseDeleter>;

Stream openToRead(const std::string& path);

// The file that a command edits, its backup path, and the options of the edit.
class EditedFile {
 public:
  // `family` is the name of the command's family; the paths are the editor's static members.
  EditedFile(const char* family, const char*& editors_file, const char*& editors_backup)
      : family_(family), editors_file_(editors_file), editors_backup_(editors_backup) {}

  // Adds --file and --backup to the command.
  void addOptions(Tool& tool, Command& command);
  // Add the options of the commands that write the file.
  void addEditOptions(Tool& tool, Command& command);
  void addRestoreOptions(Tool& tool, Command& command);
  // Sets the editor's paths from the options.
  void select();

 private:
  friend class Edit;
  friend Answer restore(const EditedFile& options, bool dry_run);

  std::string restoreCommand() const;

  const char* family_;
  const char*& editors_file_;
  const char*& editors_backup_;
  std::optional<std::string> file_;
  std::optional<std::string> backup_;
  std::string path_;  // set by select()
  std::string backup_path_;
  bool no_lock_ = false;
  bool discard_backup_ = false;
  bool yes_ = false;
  bool force_ = false;
};

// One edit of a file: takes the lock, checks before the edit, and verifies the result.
class Edit {
 public:
  // Takes the file's lock, except in a dry run, and reads the file.
  Edit(const EditedFile& options, bool dry_run);
  ~Edit();
  Edit(const Edit&) = delete;
  Edit& operator=(const Edit&) = delete;

  // The contents before the edit.
  const std::string& before() const { return before_; }
  // Whether a line had the name as its first word, which ends at a character of `ends`. The editor's
  // list may lack it: there, a read error counts as the end of the file.
  bool hasLineOf(const std::string& name, std::string_view ends) const;

  void requireCompleteLastLine() const;

  // append() and remove() check beforehand that the edit can succeed. In a dry run, they return its
  // diff. Otherwise they call the editor and verify the file; a failure names the state of the file
  // and its copy, and the command that repairs them.
  //
  // `is_there` reads the file again and returns whether the editor finds the new line. A partly
  // written line is removed. Returns nullopt after the edit.
  std::optional<Answer> append(const std::string& name, const std::string& line,
                               const std::function<int()>& add,
                               const std::function<bool()>& is_there);
  // Removes the lines whose first word is the name. A word ends at a character of `ends`.
  // `is_there` reads the file again and returns whether the editor still finds the name.
  struct Lines {
    const char* entry;  // "a service"
    const char* key;    // "name"
    std::string_view ends;
  };
  Answer remove(const Lines& lines, const std::string& name, const std::function<int()>& remove,
                const std::function<bool()>& is_there);

 private:
  std::optional<Answer> prepareToAppend(const std::string& line);
  std::optional<Answer> prepareToDelete(const std::string& wanted);
  void finishAddition(int code, const std::string& line, std::optional<bool> is_there,
                      const std::string& what);
  void finishDeletion(int code, const std::string& wanted, const std::string& what);
  void openToWrite(int flags);
  void requireFreeBackup();
  void requireRoomForCopy() const;
  void requireDescriptors() const;
  std::optional<Answer> diffOrDiscardBackup(const std::string& wanted) const;
  bool restoreContents();

  const EditedFile& options_;
  const std::string& path_;
  const std::string& backup_;
  bool dry_run_;
  bool discard_ = false;
  int descriptor_ = -1;
  std::optional<EditLock> lock_;
  std::string before_;
};

// Puts the copy that a failed deletion left back into the file, unless the file begins with all of
// it, and removes the copy. The copy stays complete until the file is.
Answer restore(const EditedFile& options, bool dry_run);

extern const char* const kDeletionHelp;
extern const char* const kRestorationHelp;

// Adds the commands of a family that edits a file. Options has the EditedFile as its member `file`.
template <typename Options>
class EditCommands {
 public:
  EditCommands(Tool& tool, Command& family, std::shared_ptr<Options> options)
      : tool_(tool), family_(family), options_(std::move(options)) {}

  Command& command(const char* name, const std::string& description, Answer (*action)(Options&),
                   const std::vector<Tool::Argument>& arguments = {}) {
    const auto run = [options = options_, action] {
      options->file.select();
      return action(*options);
    };
    return withFile(tool_.command(family_, name, description, run, arguments));
  }

  Command& edit(const char* name, const std::string& description, Answer (*action)(Options&, bool),
                const std::vector<Tool::Argument>& arguments) {
    Command& added = change(name, description, action, arguments);
    options_->file.addEditOptions(tool_, added);
    return added;
  }

  void deletion(const std::string& what, Answer (*action)(Options&, bool),
                const Tool::Argument& name) {
    edit("delete", "Remove all lines of " + what + kDeletionHelp, action, {name});
  }

  void restoration() {
    options_->file.addRestoreOptions(
        tool_, change("restore", kRestorationHelp, [](Options& options, bool dry_run) {
          return restore(options.file, dry_run);
        }));
  }

 private:
  Command& change(const char* name, const std::string& description,
                  Answer (*action)(Options&, bool),
                  const std::vector<Tool::Argument>& arguments = {}) {
    const auto run = [options = options_, action](bool dry_run) {
      options->file.select();
      return action(*options, dry_run);
    };
    return withFile(tool_.change(family_, name, description, run, arguments));
  }

  Command& withFile(Command& command) {
    options_->file.addOptions(tool_, command);
    return command;
  }

  Tool& tool_;
  Command& family_;
  std::shared_ptr<Options> options_;
};

bool isAsciiLetter(char c);
bool isAsciiDigit(char c);
bool isAsciiControl(char c);
