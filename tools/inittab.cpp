// The inittab commands: look at and edit the entries of the inittab file.
#include <string.h>

#include <algorithm>
#include <iterator>
#include <memory>
#include <string>
#include <string_view>

#include "command.h"
#include "edited_file.h"

namespace inittab {
namespace {

using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

struct Options {
  EditedFile file{"inittab"};
  std::string id;
  std::string runlevels;
  std::string action;
  std::string process;
  bool force = false;
};

// Those of System V's init.
constexpr const char* kActions[] = {"respawn",      "wait",       "once",      "boot",
                                    "bootwait",     "off",        "ondemand",  "initdefault",
                                    "sysinit",      "powerwait",  "powerfail", "powerokwait",
                                    "powerfailnow", "ctrlaltdel", "kbrequest"};

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

Answer add(Options& options, bool dry_run) {
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
  if (!options.force &&
      std::find(std::begin(kActions), std::end(kActions), options.action) == std::end(kActions)) {
    throw Usage("ACTION is unknown to init (--force adds it anyway): " + inQuotes(options.action));
  }
  Edit edit(options.file, dry_run);
  EtcInittab inittab;
  load(inittab);
  if (!isLastLineComplete(edit.before())) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM,
                  "the last line of " + path + " has no newline: the new one would join it");
  }
  if (inittab.doesInittabEntryExist(id.c_str())) {
    throw Failure(OSUTILS_ALREADY_EXISTS, path + " has an entry " + inQuotes(id));
  }

  const std::string line =
      id + ":" + options.runlevels + ":" + options.action + ":" + options.process + "\n";
  if (const auto answer = edit.prepareToAppend(line)) return *answer;
  const int code = inittab.addInittabEntry(id.c_str(), options.runlevels.c_str(),
                                           options.action.c_str(), options.process.c_str());
  EtcInittab written;  // the editor does not report write errors
  load(written);
  Answer wanted = {{"id", id},
                   {"runlevels", options.runlevels},
                   {"action", options.action},
                   {"process", options.process}};
  const InittabEntry* const entry = written.getInittabEntry(id.c_str());
  edit.finishAddition(code, line, entry != nullptr && answerOf(*entry) == wanted,
                      "add " + inQuotes(id) + " to " + path);
  return wanted;
}

// The text without the lines whose text before the first ":" is the id, as the editor leaves it.
std::string without(const std::string& id, const std::string& text) {
  std::string rest;
  forEachLine(text, [&](std::string_view line) {
    const std::string_view entry =
        line.substr(std::min(line.find_first_not_of(" \t\n\v\f\r"), line.size()));
    if (entry.substr(0, entry.find_first_of(std::string_view(":\0", 2))) != id) rest += line;
  });
  return rest;
}

Answer deleteEntry(Options& options, bool dry_run) {
  const std::string path = inittabFile();
  const std::string& id = options.id;
  Edit edit(options.file, dry_run);
  EtcInittab inittab;
  load(inittab);
  if (!inittab.doesInittabEntryExist(id.c_str())) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT, path + " has no entry " + inQuotes(id));
  }
  const std::string wanted = without(id, edit.before());
  if (wanted == edit.before()) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM,
                  "no line of " + path + " has the exact id " + inQuotes(id));
  }
  if (const auto answer = edit.prepareToDelete(wanted)) return *answer;
  const int code = inittab.deleteInittabEntry(id.c_str());
  edit.finishDeletion(code, wanted, "delete " + inQuotes(id) + " from " + path);
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
    throw Failure(OSUTILS_NO_SUCH_OBJECT, inittabFile() + " has no entry whose command contains " +
                                              inQuotes(options.process));
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
  Command& family = tool.family("inittab", "List and edit the entries of the inittab file");

  const auto options = std::make_shared<Options>();
  const auto select = [options] {
    options->file.select(EtcInittab::ETC_INITTAB_FILE, EtcInittab::ETC_INITTAB_FILE_BACKUP);
  };
  const auto addOptions = [&](Command& command) -> Command& {
    options->file.addOptions(tool, command, "/etc/inittab");
    return command;
  };
  const auto addToFamily = [&](const char* name, const char* description,
                               Answer (*action)(Options&)) -> Command& {
    return addOptions(tool.command(family, name, description, [options, select, action] {
      select();
      return action(*options);
    }));
  };
  const auto addChange = [&](const char* name, const char* description,
                             Answer (*action)(Options&, bool)) -> Command& {
    return addOptions(
        tool.change(family, name, description, [options, select, action](bool dry_run) {
          select();
          return action(*options, dry_run);
        }));
  };
  const auto takeId = [&](Command& command) {
    tool.text(command, "ID", options->id, "The entry's id");
  };

  addToFamily("list", "Show all entries in the order of the file", list);
  Command& addition = addChange("add", "Append an entry to the file and show it", add);
  options->file.addEditOptions(tool, addition);
  tool.flag(addition, "--force", options->force, "Add an action that init does not know");
  takeId(addition);
  tool.text(addition, "RUNLEVELS", options->runlevels, "Where it is active, for instance 2345");
  tool.text(addition, "ACTION", options->action, "What init does, for instance respawn");
  tool.text(addition, "PROCESS", options->process, "The command that init runs");
  Command& deletion =
      addChange("delete",
                "Remove all lines of an id. The file is rewritten in place: keep\n"
                "programs that ignore its lock from editing it. The backup path has a\n"
                "copy until the command ends; an older copy there stops the command",
                deleteEntry);
  options->file.addEditOptions(tool, deletion);
  takeId(deletion);
  options->file.addRestoreOptions(
      tool, addChange("restore",
                      "Show how the file differs from the copy that a failed deletion left,\n"
                      "ask, put the copy back and remove it. If the file begins with all of\n"
                      "the copy, only remove the copy",
                      [](Options& chosen, bool dry_run) { return restore(chosen.file, dry_run); }));
  tool.text(addToFamily("find", "Show the first entry whose command contains a text", find), "TEXT",
            options->process, "Any part of the command");
  addToFamily("free-id", "Show the first of the product's ids that no entry uses", freeId);
}

}  // namespace inittab
