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

// Which file the command works on, where its editor keeps a copy meanwhile, and how careful it is.
class EditedFile {
 public:
  // `family` is the one that the command belongs to, the paths are the editor's class-wide ones.
  EditedFile(const char* family, const char*& editors_file, const char*& editors_backup)
      : family_(family), editors_file_(editors_file), editors_backup_(editors_backup) {}

  // Adds --file and --backup to the command.
  void addOptions(Tool& tool, Command& command);
  // Adds what only the commands that write the file have.
  void addEditOptions(Tool& tool, Command& command);
  void addRestoreOptions(Tool& tool, Command& command);
  // Points the editor's paths at what the options say.
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

  void requireCompleteLastLine() const;

  // Both make sure that the edit can end well, as far as that can be known. Then, in a dry run, the answer
  // is the difference that it would make. Otherwise they have the editor do it, and fail if it did not,
  // with the state of the file and its copy, and the command that puts them right.
  //
  // `is_there` reads the file again and says whether the editor finds the addition. A part of the line is
  // taken away.
  std::optional<Answer> append(const std::string& name, const std::string& line,
                               const std::function<int()>& add,
                               const std::function<bool()>& is_there);
  // Deletes the lines whose first word, up to one of the characters in `ends`, is the name. `is_there`
  // reads the file again and says whether the editor still finds the name.
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
  void finishAddition(int code, const std::string& line, bool is_there, const std::string& what);
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

// Puts the copy that a deletion left behind back into the file, unless all of it is there, and removes it.
// The copy stays whole until the file is.
Answer restore(const EditedFile& options, bool dry_run);

extern const char* const kDeletionHelp;
extern const char* const kRestorationHelp;

// The commands of a family that edits a file. Their Options have the EditedFile as `file`.
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

  // A command that edits the file.
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
