// EtcInittab on a private file, compared with a model after every step.
//
// An input is the file's contents and then steps, each after a record separator: one letter, and fields after field
// separators.
#include <stddef.h>

#include <string>
#include <vector>

#include "fuzz.h"
#include "inittab_model.h"
#include "osutils.h"
#include "platform.h"

using VRAOSUtils::EtcInittab;
using VRAOSUtils::InittabEntry;

namespace {

struct Files {
  Files() {
    EtcInittab::ETC_INITTAB_FILE = file.c_str();
    EtcInittab::ETC_INITTAB_FILE_BACKUP = backup.c_str();
  }

  const Folder folder;
  const std::string file = folder.path("inittab");
  const std::string backup = folder.path("inittab.save");
};

std::string bytesOf(const InittabEntry& entry) {
  return {reinterpret_cast<const char*>(&entry), kCommandOffset + sizeof entry.process};
}

std::string shownList(const std::vector<std::string>& list) {
  std::string text;
  for (const std::string& record : list) text += shown(record) + "\n";
  return text;
}

std::vector<std::string> listOf(const EtcInittab& inittab) {
  // After the virtual table and the path.
  const InittabEntry* entry;
  memcpy(&entry, reinterpret_cast<const char*>(&inittab) + 16, sizeof entry);
  std::vector<std::string> list;
  for (; entry != nullptr; entry = entry->next) list.push_back(bytesOf(*entry));
  return list;
}

std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

void compareIds(EtcInittab& inittab, const InittabModel& model, const std::string& id) {
  expectSame("doesInittabEntryExist", inittab.doesInittabEntryExist(id.c_str()), model.has(id));
  const InittabEntry* const entry = inittab.getInittabEntry(id.c_str());
  expectSame("getInittabEntry", entry != nullptr, model.has(id));
  if (entry != nullptr) expectSame("id of getInittabEntry", upToNul(bytesOf(*entry)), id);
}

void compareCommands(EtcInittab& inittab, const InittabModel& model, const std::string& command) {
  const std::string* const expected = model.withCommand(command);
  expectSame("isCommandRegistered", inittab.isCommandRegistered(command.c_str()),
             expected != nullptr);
  const InittabEntry* const entry = inittab.getInittabEntryWithCommand(command.c_str());
  expectSame("getInittabEntryWithCommand", entry == nullptr ? "(none)" : bytesOf(*entry),
             expected == nullptr ? "(none)" : *expected);
  expectSame("getEntryInitIDWithCommand", taken(inittab.getEntryInitIDWithCommand(command.c_str())),
             expected == nullptr ? "(none)" : upToNul(*expected));
}

void takeStep(EtcInittab& inittab, InittabModel& model, const std::string& file,
              const std::string& step) {
  std::vector<std::string> fields = partsOf(upToNul(step), kFieldSeparator);
  fields.resize(5);
  const std::string& first = fields[1];
  switch (fields[0].empty() ? '\0' : fields[0][0]) {
    case 'r':
      expectSame("readInittab", inittab.readInittab(), model.read());
      break;
    case 'a':
      expectSame("addInittabEntry",
                 inittab.addInittabEntry(first.c_str(), fields[2].c_str(), fields[3].c_str(),
                                         fields[4].c_str()),
                 model.add(first, fields[2], fields[3], fields[4]));
      break;
    case 'd':
      expectSame("deleteInittabEntry", inittab.deleteInittabEntry(first.c_str()),
                 model.remove(first));
      break;
    case 'q':
      compareIds(inittab, model, first);
      break;
    case 'c':
      compareCommands(inittab, model, first);
      break;
    case 'i':
      EtcInittab::ETC_INITTAB_PREFIX_ID = first.c_str();
      expectSame("findAvaliableID", taken(inittab.findAvaliableID()), model.freeId(first));
      break;
    case 'f':
      inittab.freeInittabEntries();
      model.forget();
      break;
    case 't':
      trcEvents = ~trcEvents;
      break;
    case 'w':  // another program adds this text
      writeTo(file, first, O_APPEND);
      model.write(first);
      break;
    case 'x':  // ... or removes the file
      unlink(file.c_str());
      model.removeFile();
      break;
    default:
      break;
  }
}

void compareFiles(const Files& files, const std::string& expected) {
  const bool has_file = access(files.file.c_str(), F_OK) == 0;
  expectSame("file", has_file ? contentsOf(files.file) : "", expected);
  if (access(files.backup.c_str(), F_OK) == 0) fail("backup", "it was left", "none");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const Files files;
  trcEvents = 0;
  const std::vector<std::string> parts =
      partsOf({reinterpret_cast<const char*>(data), size}, kRecordSeparator);
  InittabModel model(parts[0]);
  writeTo(files.file, parts[0]);

  EtcInittab inittab;
  for (size_t i = 0; i < parts.size(); ++i) {
    const std::string before = model.contents();
    takeStep(inittab, model, files.file, i == 0 ? "r" : parts[i]);
    const auto list = listOf(inittab);
    if (list != model.list()) fail("list", shownList(list), shownList(model.list()));
    if (model.contents() != before) compareFiles(files, model.contents());
  }
  compareFiles(files, model.contents());
  return 0;
}
