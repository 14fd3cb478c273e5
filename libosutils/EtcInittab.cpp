// Reads and edits the inittab file, which gives each command that init runs an id.

#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <memory>

#include "cancellation.h"
#include "line_file.h"
#include "osutils.h"
#include "platform.h"
#include "text.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::TraceScope;

namespace VRAOSUtils {

namespace {

// Clients are compiled with this layout.
// sic: a value that fills its array has no NUL of its own.
static_assert(offsetof(InittabEntry, id) == 0);
static_assert(offsetof(InittabEntry, runlevels) == 10);
static_assert(offsetof(InittabEntry, action) == 20);
static_assert(offsetof(InittabEntry, process) == 50);

constexpr size_t kMaxCommandLength = sizeof(InittabEntry::process) - 1;

using OwnedEntry = std::unique_ptr<InittabEntry, osutils::FreeDeleter>;

// Zeroed, so that a value shorter than its array ends in a NUL.
OwnedEntry newEntry() {
  return OwnedEntry(static_cast<InittabEntry*>(calloc(1, sizeof(InittabEntry))));
}

// The id as a string, which continues into the next field when it fills its array. The pointer is
// derived from the record: a compiler may assume that a string does not leave its array.
const char* idOf(const InittabEntry& entry) {
  return reinterpret_cast<const char*>(&entry) + offsetof(InittabEntry, id);
}

// A line with any other first character is a comment.
bool beginsEntry(char c) { return osutils::isLetter(c) || osutils::isDigit(c); }

// Copies the field at `text`, up to a ":" or `end`, and returns the start of the next field.
// sic: the rest of a field that is too wide is the next field.
template <size_t Width>
const char* parseField(char (&field)[Width], const char* text, const char* end) {
  for (size_t i = 0; i < Width && text != end && *text != ':'; ++i) field[i] = *text++;
  return text != end && *text == ':' ? text + 1 : text;
}

// Parses the entry at `text`, whose line ends at `end`.
// sic: only the command drops the newline, so the last of too few fields contains it.
void parseEntry(InittabEntry& entry, const char* text, const char* end) {
  text = parseField(entry.id, text, end);
  text = parseField(entry.runlevels, text, end);
  text = parseField(entry.action, text, end);
  const size_t room = std::min(static_cast<size_t>(end - text), kMaxCommandLength);
  size_t length = strnlen(text, room);
  if (length != 0 && text[length - 1] == '\n') --length;
  memcpy(entry.process, text, length);
}

void copyField(char* field, size_t width, const char* value) {
  memcpy(field, value, strnlen(value, width));
}

// Returns whether the line's text before the first ":" is `id`. In a line without ":" that text
// contains the newline, as the record's id does.
bool lineHasId(const char* line, const char* id, size_t id_length) {
  const char* const text = osutils::skipSpace(line);
  return beginsEntry(*text) && static_cast<size_t>(strchrnul(text, ':') - text) == id_length &&
         memcmp(text, id, id_length) == 0;
}

}  // namespace

const char* EtcInittab::ETC_INITTAB_FILE = "/etc/inittab";
const char* EtcInittab::ETC_INITTAB_FILE_BACKUP = "/etc/inittab.vrasave";
const char* EtcInittab::ETC_INITTAB_PREFIX_ID = "vra";

TRACED EtcInittab::EtcInittab() : filePath(nullptr), inittabEntries(nullptr) {
  TraceScope<traced::EtcInittab_EtcInittab> trace;
  filePath = strdup(ETC_INITTAB_FILE);
}

TRACED EtcInittab::~EtcInittab() {
  TraceScope<traced::EtcInittab_destructor> trace;
  free(filePath);
  freeInittabEntries();
}

TRACED int EtcInittab::readInittab() {
  TraceScope<traced::EtcInittab_readInittab> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  freeInittabEntries();
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);
  osutils::OwnedStream stream = osutils::openStream(filePath, "r");
  if (!stream) {
    DEBUG_MESSAGE(trace, "EtcInittab: fopen: errno =%d\n", errno);
    return trace.result(OSUTILS_UNWILLING_TO_PERFORM);
  }

  bool has_memory = true;
  InittabEntry** tail = &inittabEntries;
  for (osutils::LineReader reader(stream.get()); reader.next();) {
    const char* const text = osutils::skipSpace(reader.text());
    if (!beginsEntry(*text)) continue;
    OwnedEntry entry = newEntry();
    if (!entry) {
      has_memory = false;
      break;
    }
    parseEntry(*entry, text, reader.text() + reader.length());
    *tail = entry.release();
    tail = &(*tail)->next;
  }
  stream.reset();

  if (!has_memory) {
    freeInittabEntries();
    DEBUG_MESSAGE(trace, "EtcInittab: readInittab: ran out of memory.\n");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  return trace.result(OSUTILS_SUCCESS);
}

// sic: some messages have ":" after the class and some "::", some "errno=%d." and one "errno =%d".

TRACED int EtcInittab::addInittabEntry(const char* id, const char* runlevels, const char* action,
                                       const char* process) {
  TraceScope<traced::EtcInittab_addInittabEntry> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (id == nullptr || runlevels == nullptr || action == nullptr || process == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: addInittabEntry: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (doesInittabEntryExist(id)) return trace.result(OSUTILS_ALREADY_EXISTS);
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);

  OwnedEntry entry = newEntry();
  if (!entry) {
    DEBUG_MESSAGE(trace, "EtcInittab::addInittabEntry ran out of memory.\n");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  copyField(entry->id, sizeof entry->id, id);
  copyField(entry->runlevels, sizeof entry->runlevels, runlevels);
  copyField(entry->action, sizeof entry->action, action);
  copyField(entry->process, kMaxCommandLength, process);

  const auto format_line = [&](char** line) {
    const int rc = vra_asprintf(line, "%s:%s:%s:%s\n", id, runlevels, action, process);
    if (rc == -1) DEBUG_MESSAGE(trace, "EtcInittab::addInittabEntry vra_asprintf failed.\n");
    return rc;
  };
  switch (osutils::appendLine(filePath, format_line)) {
    case osutils::Append::kCannotOpen:
      DEBUG_MESSAGE(trace, "EtcInittab::addInittabEntry fopen: errno=%d.\n", errno);
      return trace.result(OSUTILS_INSUFFICIENT_ACCESS);
    case osutils::Append::kCannotFormat:
      return trace.result(OSUTILS_NO_MEMORY);
    case osutils::Append::kDone:
      break;
  }
  entry->next = inittabEntries;
  inittabEntries = entry.release();
  return trace.result(OSUTILS_SUCCESS);
}

TRACED int EtcInittab::deleteInittabEntry(const char* id) {
  TraceScope<traced::EtcInittab_deleteInittabEntry> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (id == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: deleteInittabEntry: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (!doesInittabEntryExist(id)) return trace.result(OSUTILS_NO_SUCH_OBJECT);
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);

  const char* const backup = ETC_INITTAB_FILE_BACKUP;
  if (!osutils::copyToBackup(filePath, backup)) {
    DEBUG_MESSAGE(trace, "EtcInittab::deleteInittabEntry copy of %s to %s failed.\n", filePath,
                  backup);
    return trace.result(OSUTILS_INSUFFICIENT_ACCESS);
  }
  const size_t id_length = strlen(id);
  const bool rewritten = osutils::rewriteFromBackup(
      filePath, backup, [&](const char* line) { return lineHasId(line, id, id_length); },
      [&](int error) {
        DEBUG_MESSAGE(trace, "EtcInittab::deleteInittabEntry fopen: errno=%d.\n", error);
      },
      [&] {
        DEBUG_MESSAGE(trace, "EtcInittab::deleteInittabEntry copy of %s to %s failed.\n", backup,
                      filePath);
      });
  if (!rewritten) return trace.result(OSUTILS_INSUFFICIENT_ACCESS);

  // sic: every matching line is deleted, but only the first record.
  for (InittabEntry** link = &inittabEntries; *link != nullptr; link = &(*link)->next) {
    if (strcmp(idOf(**link), id) == 0) {
      const OwnedEntry unlinked(*link);
      *link = unlinked->next;
      break;
    }
  }
  return trace.result(OSUTILS_SUCCESS);
}

TRACED bool EtcInittab::doesInittabEntryExist(const char* id) {
  TraceScope<traced::EtcInittab_doesInittabEntryExist> trace;

  if (id == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: doesInittabEntryExist: passed a null pointer.\n");
    return trace.result(false);
  }
  return trace.result(getInittabEntry(id) != nullptr);
}

TRACED bool EtcInittab::isCommandRegistered(const char* command) {
  TraceScope<traced::EtcInittab_isCommandRegistered> trace;

  if (command == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: isCommandRegistered: passed a null pointer.\n");
    return trace.result(false);
  }
  return trace.result(getInittabEntryWithCommand(command) != nullptr);
}

TRACED char* EtcInittab::findAvaliableID() {
  TraceScope<traced::EtcInittab_findAvaliableID> trace;

  for (char suffix[] = "0"; suffix[0] <= 'z';
       suffix[0] = suffix[0] == '9' ? 'a' : static_cast<char>(suffix[0] + 1)) {
    char* candidate = nullptr;
    // An id that cannot be formatted is skipped as if it were taken.
    if (vra_asprintf(&candidate, "%s%s", ETC_INITTAB_PREFIX_ID, suffix) == -1) continue;
    osutils::OwnedString id(candidate);
    if (!doesInittabEntryExist(id.get())) return id.release();
  }
  DEBUG_MESSAGE(trace, "EtcInittab::findAvaliableID did not find avaliable id.\n");
  return nullptr;
}

TRACED InittabEntry* EtcInittab::getInittabEntry(const char* id) {
  TraceScope<traced::EtcInittab_getInittabEntry> trace;

  if (id == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: getInittabEntry: passed a null pointer.\n");
    return nullptr;
  }
  for (InittabEntry* entry = inittabEntries; entry != nullptr; entry = entry->next) {
    if (strcmp(idOf(*entry), id) == 0) return entry;
  }
  return nullptr;
}

TRACED InittabEntry* EtcInittab::getInittabEntryWithCommand(const char* command) {
  TraceScope<traced::EtcInittab_getInittabEntryWithCommand> trace;

  if (command == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: getInittabEntryWithCommand: passed a null pointer.\n");
    return nullptr;
  }
  for (InittabEntry* entry = inittabEntries; entry != nullptr; entry = entry->next) {
    if (strstr(entry->process, command) != nullptr) return entry;
  }
  return nullptr;
}

TRACED char* EtcInittab::getEntryInitIDWithCommand(const char* command) {
  TraceScope<traced::EtcInittab_getEntryInitIDWithCommand> trace;

  if (command == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: getEntryInitIDWithCommand: passed a null pointer.\n");
    return nullptr;
  }
  const InittabEntry* const entry = getInittabEntryWithCommand(command);
  if (entry == nullptr) {
    DEBUG_MESSAGE(trace, "EtcInittab: getEntryInitIDWithCommand: No entry found.\n");
    return nullptr;
  }
  return strdup(idOf(*entry));
}

TRACED void EtcInittab::freeInittabEntries() {
  TraceScope<traced::EtcInittab_freeInittabEntries> trace;

  while (inittabEntries != nullptr) {
    InittabEntry* const head = inittabEntries;
    inittabEntries = head->next;
    free(head);
  }
}

}  // namespace VRAOSUtils
