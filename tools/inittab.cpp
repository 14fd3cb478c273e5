// The inittab commands: look at and edit the entries of the inittab file.
#include <string.h>

#include <algorithm>
#include <memory>

#include "command.h"
#include "edited_file.h"

namespace inittab {
namespace {

using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

struct Options {
  EditedFile file;
  std::string id;
  std::string runlevels;
  std::string action;
  std::string process;
};

std::string inittabFile() { return EtcInittab::ETC_INITTAB_FILE; }

template <size_t Width>
std::string textOf(const char (&field)[Width]) {
  return {field, strnlen(field, Width)};
}

Answer answerOf(const InittabEntry& entry) {
  return {{"id", textOf(entry.id)},
          {"runlevels", textOf(entry.runlevels)},
          {"action", textOf(entry.action)},
          {"process", textOf(entry.process)}};
}

void load(EtcInittab& inittab) {
  const std::string path = inittabFile();
  requireRegularFile(path);  // commands read the file more than once
  const int code = inittab.readInittab();
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot read " + path);
}

Answer list(Options&) {
  EtcInittab inittab;
  load(inittab);
  Answer entries = Answer::array();
  // Every command contains the empty text, so this is the first entry of all.
  for (const InittabEntry* entry = inittab.getInittabEntryWithCommand(""); entry != nullptr;
       entry = entry->next) {
    entries.push_back(answerOf(*entry));
  }
  return entries;
}

// Refuses what the editor would cut or take for something else when it reads its line again.
void requireField(const char* argument, const std::string& text, size_t most,
                  bool may_have_colons) {
  const bool is_good = text.size() <= most &&
                       std::none_of(text.begin(), text.end(), isAsciiControl) &&
                       (may_have_colons || text.find(':') == std::string::npos);
  if (!is_good) {
    throw Usage(std::string(argument) + " must have at most " + std::to_string(most) +
                " characters, " + (may_have_colons ? "" : "no colons and ") +
                "no control characters: " + inQuotes(text));
  }
}

Answer add(Options& options) {
  const std::string path = inittabFile();
  const std::string& id = options.id;
  // One less than the arrays hold: a full one reads on into the next.
  requireField("ID", id, sizeof(InittabEntry::id) - 1, false);
  if (id.empty() || !(isAsciiLetter(id.front()) || isAsciiDigit(id.front()))) {
    throw Usage("ID must begin with a letter or a digit: " + inQuotes(id));
  }
  requireField("RUNLEVELS", options.runlevels, sizeof(InittabEntry::runlevels) - 1, false);
  requireField("ACTION", options.action, sizeof(InittabEntry::action) - 1, false);
  requireField("PROCESS", options.process, sizeof(InittabEntry::process) - 1, true);
  EtcInittab inittab;
  load(inittab);
  if (!isLastLineComplete(path)) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM,
                  "the last line of " + path + " has no newline, the new one would join it");
  }
  const int code = inittab.addInittabEntry(id.c_str(), options.runlevels.c_str(),
                                           options.action.c_str(), options.process.c_str());
  if (code == OSUTILS_ALREADY_EXISTS) throw Failure(code, path + " has an entry " + inQuotes(id));
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot add " + inQuotes(id) + " to " + path);

  EtcInittab written;  // the editor does not report write errors
  load(written);
  Answer wanted = {{"id", id},
                   {"runlevels", options.runlevels},
                   {"action", options.action},
                   {"process", options.process}};
  const InittabEntry* const entry = written.getInittabEntry(id.c_str());
  if (entry == nullptr || answerOf(*entry) != wanted || !isLastLineComplete(path)) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  "the new line of " + inQuotes(id) + " is not complete in " + path);
  }
  return wanted;
}

Answer deleteEntry(Options& options) {
  const std::string path = inittabFile();
  const std::string& id = options.id;
  EtcInittab inittab;
  load(inittab);
  const int code = inittab.deleteInittabEntry(id.c_str());
  if (code == OSUTILS_NO_SUCH_OBJECT) throw Failure(code, path + " has no entry " + inQuotes(id));
  if (code != OSUTILS_SUCCESS) {
    throw Failure(code, "cannot delete " + inQuotes(id) + " from " + path +
                            copyLeftAt(EtcInittab::ETC_INITTAB_FILE_BACKUP, path));
  }
  EtcInittab written;
  load(written);
  if (written.doesInittabEntryExist(id.c_str())) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, path + " still has an entry " + inQuotes(id));
  }
  return {{"deleted", id}};
}

Answer find(Options& options) {
  EtcInittab inittab;
  load(inittab);
  const InittabEntry* const entry = inittab.getInittabEntryWithCommand(options.process.c_str());
  if (entry == nullptr) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT,
                  inittabFile() + " has no entry whose command has " + inQuotes(options.process));
  }
  return answerOf(*entry);
}

Answer freeId(Options&) {
  EtcInittab inittab;
  load(inittab);
  char* const id = inittab.findAvaliableID();
  if (id == nullptr) {
    throw Failure(OSUTILS_UNAVAILABLE, std::string("all ids that begin with ") +
                                           EtcInittab::ETC_INITTAB_PREFIX_ID + " are taken in " +
                                           inittabFile());
  }
  return {{"id", take(id)}};
}

}  // namespace

void addCommands(Tool& tool) {
  Command& family = tool.family("inittab", "Look at and edit the inittab file");

  const auto options = std::make_shared<Options>();
  const auto addToFamily = [&](const char* name, const char* description,
                               Answer (*action)(Options&)) -> Command& {
    Command& command = tool.command(family, name, description, [options, action] {
      options->file.select(EtcInittab::ETC_INITTAB_FILE, EtcInittab::ETC_INITTAB_FILE_BACKUP);
      return action(*options);
    });
    options->file.addOptions(tool, command, "/etc/inittab");
    return command;
  };
  const auto takeId = [&](Command& command) {
    tool.text(command, "ID", options->id, "The entry's id");
  };

  addToFamily("list", "Show all entries in the order of the file", list);
  Command& addition = addToFamily("add", "Append an entry to the file and show it", add);
  takeId(addition);
  tool.text(addition, "RUNLEVELS", options->runlevels, "When it is active, for instance 2345");
  tool.text(addition, "ACTION", options->action, "What init does, for instance respawn");
  tool.text(addition, "PROCESS", options->process, "The command that init runs");
  takeId(addToFamily("delete",
                     "Remove all lines of an id. The file is rewritten in place: keep other\n"
                     "programs from editing it meanwhile. A copy at the backup path, which is\n"
                     "overwritten, exists only until the command ends",
                     deleteEntry));
  tool.text(addToFamily("find", "Show the first entry whose command contains a text", find), "TEXT",
            options->process, "Any part of the command");
  addToFamily("free-id", "Show the first id of the product's that no entry uses", freeId);
}

}  // namespace inittab
