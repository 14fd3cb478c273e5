// The inittab commands.
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
  EditedFile file{"inittab", EtcInittab::ETC_INITTAB_FILE, EtcInittab::ETC_INITTAB_FILE_BACKUP};
  std::string id;
  std::string runlevels;
  std::string action;
  std::string process;
  bool force = false;
};

// The actions of System V init.
constexpr const char* kActions[] = {"respawn",      "wait",       "once",      "boot",
                                    "bootwait",     "off",        "ondemand",  "initdefault",
                                    "sysinit",      "powerwait",  "powerfail", "powerokwait",
                                    "powerfailnow", "ctrlaltdel", "kbrequest"};

constexpr std::string_view kIdEnds(":\0", 2);

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
  // The path is not null, but the editor could not copy it.
  if (code == OSUTILS_PARAM_ERROR) throw std::bad_alloc();
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot read " + path);
}

Answer list(Options&) {
  EtcInittab inittab;
  load(inittab);
  Answer entries = Answer::array();
  // Every command contains the empty text, so this finds the first entry.
  for (const InittabEntry* entry = inittab.getInittabEntryWithCommand(""); entry != nullptr;
       entry = entry->next) {
    entries.push_back(answerOf(*entry));
  }
  return entries;
}

// Refuses a field that the editor would truncate or misread when it reads its line back.
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
  // One less than the arrays hold: a full array has no NUL, and reading continues in the next.
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
  edit.requireCompleteLastLine();
  if (inittab.doesInittabEntryExist(id.c_str()) || edit.hasLineOf(id, kIdEnds)) {
    throw Failure(OSUTILS_ALREADY_EXISTS, path + " has an entry " + inQuotes(id));
  }

  const std::string line =
      id + ":" + options.runlevels + ":" + options.action + ":" + options.process + "\n";
  const Answer wanted = {{"id", id},
                         {"runlevels", options.runlevels},
                         {"action", options.action},
                         {"process", options.process}};
  const auto addEntry = [&] {
    return inittab.addInittabEntry(id.c_str(), options.runlevels.c_str(), options.action.c_str(),
                                   options.process.c_str());
  };
  const auto isThere = [&] {
    EtcInittab written;  // the editor does not report write errors
    load(written);
    const InittabEntry* const entry = written.getInittabEntry(id.c_str());
    return entry != nullptr && answerOf(*entry) == wanted;
  };
  return edit.append(id, line, addEntry, isThere).value_or(wanted);
}

Answer deleteEntry(Options& options, bool dry_run) {
  const std::string& id = options.id;
  Edit edit(options.file, dry_run);
  EtcInittab inittab;
  load(inittab);
  if (!inittab.doesInittabEntryExist(id.c_str())) {
    throw Failure(OSUTILS_NO_SUCH_OBJECT, inittabFile() + " has no entry " + inQuotes(id));
  }
  return edit.remove(
      {"an entry", "id", kIdEnds}, id, [&] { return inittab.deleteInittabEntry(id.c_str()); },
      [&] {
        EtcInittab written;
        load(written);
        return written.doesInittabEntryExist(id.c_str());
      });
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
  const std::optional<std::string> id = osutils::take(inittab.findAvaliableID());
  if (!id) {
    throw Failure(OSUTILS_UNAVAILABLE, std::string("all ids that begin with ") +
                                           EtcInittab::ETC_INITTAB_PREFIX_ID + " are taken in " +
                                           inittabFile());
  }
  return {{"id", *id}};
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  const Tool::Argument id = {"ID", &options->id, "The entry's id"};
  EditCommands<Options> commands(
      tool, tool.family("inittab", "List and edit the entries of the inittab file"), options);

  commands.command("list", "Show all entries in the order of the file", list);
  Command& addition = commands.edit(
      "add", "Append an entry to the file and show it", add,
      {id,
       {"RUNLEVELS", &options->runlevels, "The run levels of the entry, for instance 2345"},
       {"ACTION", &options->action, "What init does, for instance respawn", oneOf(kActions)},
       {"PROCESS", &options->process, "The command that init runs"}});
  tool.flag(addition, "--force", options->force, "Add an action that init does not know");
  commands.deletion("an id", deleteEntry, id);
  commands.restoration();
  commands.command("find", "Show the first entry whose command contains a text", find,
                   {{"TEXT", &options->process, "Any part of the command"}});
  commands.command("free-id", "Show the first of the product's ids that no entry uses", freeId);
}

}  // namespace inittab
