// Reads and edits the services file, which gives each service its port.

#include <stdlib.h>
#include <string.h>

#include <bitset>
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

constexpr size_t kMaxNameLength = sizeof(ServicesEntry::name) - 1;

using OwnedEntry = std::unique_ptr<ServicesEntry, osutils::FreeDeleter>;

OwnedEntry newEntry() {
  return OwnedEntry(static_cast<ServicesEntry*>(malloc(sizeof(ServicesEntry))));
}

void setName(ServicesEntry& entry, const char* name, size_t length) {
  if (length > kMaxNameLength) length = kMaxNameLength;
  memcpy(entry.name, name, length);
  entry.name[length] = '\0';
}

bool isPortInRange(int port) {
  return port >= EtcServices::ETC_SERVICE_MIN_PORT && port <= EtcServices::ETC_SERVICE_MAX_PORT;
}

// One bit for each port. 2 KiB, because the caller's stack may be small.
constexpr int kPortsPerBlock = 16 * 1024;
using PortSet = std::bitset<kPortsPerBlock>;

// The ports in use from `first` on, as offsets from it.
PortSet portsInUse(const ServicesEntry* entries, int first) {
  PortSet in_use;
  for (const ServicesEntry* entry = entries; entry != nullptr; entry = entry->next) {
    const long offset = static_cast<long>(entry->port) - first;
    if (offset >= 0 && offset < kPortsPerBlock) in_use.set(static_cast<size_t>(offset));
  }
  return in_use;
}

// Returns whether the line's first word is `name`.
bool lineHasName(const char* line, const char* name, size_t name_length) {
  const char* const word = osutils::skipSpace(line);
  return osutils::isLetter(*word) &&
         static_cast<size_t>(osutils::skipWord(word) - word) == name_length &&
         memcmp(word, name, name_length) == 0;
}

}  // namespace

const char* EtcServices::ETC_SERVICES_FILE = "/etc/services";
const char* EtcServices::ETC_SERVICES_FILE_BACKUP = "/etc/services.vrasave";
const int EtcServices::ETC_SERVICE_MIN_PORT;
const int EtcServices::ETC_SERVICE_MAX_PORT;
const int EtcServices::INIT_PORT_INDEX;
const int EtcServices::INIT_PORT_INDEX_INTERRUPT;

TRACED EtcServices::EtcServices() : filePath(nullptr), servicesEntries(nullptr) {
  TraceScope<traced::EtcServices_EtcServices> trace;
  filePath = strdup(ETC_SERVICES_FILE);
}

TRACED EtcServices::~EtcServices() {
  TraceScope<traced::EtcServices_destructor> trace;
  free(filePath);
  freeServicesEntries();
}

TRACED int EtcServices::readEtcServices() {
  TraceScope<traced::EtcServices_readEtcServices> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  freeServicesEntries();
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);
  osutils::OwnedStream stream = osutils::openStream(filePath, "r");
  if (!stream) {
    DEBUG_MESSAGE(trace, "EtcServices: fopen: errno =%d\n", errno);
    return trace.result(OSUTILS_UNWILLING_TO_PERFORM);
  }

  bool has_memory = true;
  ServicesEntry** tail = &servicesEntries;
  for (osutils::LineReader reader(stream.get()); reader.next();) {
    const char* const word = osutils::skipSpace(reader.text());
    if (!osutils::isLetter(*word)) continue;
    OwnedEntry entry = newEntry();
    if (!entry) {
      has_memory = false;
      break;
    }
    const char* const word_end = osutils::skipWord(word);
    setName(*entry, word, static_cast<size_t>(word_end - word));
    const char* const port = osutils::skipSpace(word_end);
    if (!osutils::isDigit(*port)) continue;
    entry->port = atoi(port);
    entry->next = nullptr;
    *tail = entry.release();
    tail = &(*tail)->next;
  }
  stream.reset();

  if (!has_memory) {
    freeServicesEntries();
    DEBUG_MESSAGE(trace, "EtcServices: readEtcServices: ran out of memory.\n");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  return trace.result(OSUTILS_SUCCESS);
}

// sic: several messages below have a "." after the newline.

TRACED int EtcServices::addService(const char* name, int port) {
  TraceScope<traced::EtcServices_addService> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "EtcServices: addService: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (doesServiceExist(name)) return trace.result(OSUTILS_ALREADY_EXISTS);
  if (!isPortAvaliable(port)) return trace.result(OSUTILS_UNAVAILABLE);
  // sic: reached only in a program that replaces isPortAvaliable, which refuses such a port above.
  if (!isPortInRange(port)) return trace.result(OSUTILS_PARAM_ERROR);
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);

  OwnedEntry entry = newEntry();
  if (!entry) {
    DEBUG_MESSAGE(trace, "EtcServices::addService ran out of memory.\n.");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  setName(*entry, name, strlen(name));
  entry->port = port;
  entry->next = nullptr;

  const auto format_line = [&](char** line) {
    const int rc = vra_asprintf(line, "%s\t%d/tcp\n", name, port);
    if (rc == -1) DEBUG_MESSAGE(trace, "EtcServices::addService vra_asprintf failed.\n");
    return rc;
  };
  switch (osutils::appendLine(filePath, format_line)) {
    case osutils::Append::kCannotOpen:
      DEBUG_MESSAGE(trace, "EtcServices::addService fopen: errno=%d\n.", errno);
      return trace.result(OSUTILS_INSUFFICIENT_ACCESS);
    case osutils::Append::kCannotFormat:
      return trace.result(OSUTILS_NO_MEMORY);
    case osutils::Append::kDone:
      break;
  }
  entry->next = servicesEntries;
  servicesEntries = entry.release();
  return trace.result(OSUTILS_SUCCESS);
}

TRACED int EtcServices::deleteService(const char* name) {
  TraceScope<traced::EtcServices_deleteService> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "EtcServices: deleteService: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }
  if (!doesServiceExist(name)) return trace.result(OSUTILS_NO_SUCH_OBJECT);
  const int perms = checkFilePerms(filePath);
  if (perms != OSUTILS_SUCCESS) return trace.result(perms);

  const char* const backup = ETC_SERVICES_FILE_BACKUP;
  if (!osutils::copyToBackup(filePath, backup)) {
    DEBUG_MESSAGE(trace, "EtcServices::deleteService copy of %s to %s failed.\n.", filePath,
                  backup);
    return trace.result(OSUTILS_INSUFFICIENT_ACCESS);
  }
  const size_t name_length = strlen(name);
  const bool rewritten = osutils::rewriteFromBackup(
      filePath, backup, [&](const char* line) { return lineHasName(line, name, name_length); },
      [&](int error) {
        DEBUG_MESSAGE(trace, "EtcServices::deleteService fopen: errno=%d\n.", error);
      },
      [&] {
        DEBUG_MESSAGE(trace, "EtcServices::deleteService copy of %s to %s failed.\n.", backup,
                      filePath);
      });
  if (!rewritten) return trace.result(OSUTILS_INSUFFICIENT_ACCESS);

  // sic: every matching line is deleted, but only the first record.
  for (ServicesEntry** link = &servicesEntries; *link != nullptr; link = &(*link)->next) {
    if (strcmp((*link)->name, name) == 0) {
      const OwnedEntry unlinked(*link);
      *link = unlinked->next;
      break;
    }
  }
  return trace.result(OSUTILS_SUCCESS);
}

TRACED bool EtcServices::doesServiceExist(const char* name) {
  TraceScope<traced::EtcServices_doesServiceExist> trace;

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "EtcServices: doesServiceExist: passed a null pointer.\n");
    return trace.result(false);
  }
  return trace.result(getServicesEntry(name) != nullptr);
}

TRACED int EtcServices::getServicePort(const char* name) {
  TraceScope<traced::EtcServices_getServicePort> trace;

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "EtcServices: getServicePort: passed a null pointer.\n");
    return -1;
  }
  const ServicesEntry* const entry = getServicesEntry(name);
  return entry != nullptr ? entry->port : -1;
}

TRACED bool EtcServices::isPortAvaliable(int port) {
  TraceScope<traced::EtcServices_isPortAvaliable> trace;

  if (!isPortInRange(port)) return trace.result(false);
  for (const ServicesEntry* entry = servicesEntries; entry != nullptr; entry = entry->next) {
    if (entry->port == port) return trace.result(false);
  }
  return trace.result(true);
}

TRACED int EtcServices::findAvaliablePort(int startPort) {
  TraceScope<traced::EtcServices_findAvaliablePort> trace;

  // Each call of isPortAvaliable reads the whole list, so ports in use are skipped unless each call
  // must leave its trace records.
  const bool is_traced = ldtr_traces(LDTR_EVENT_CLASS_33 | LDTR_EVENT_CLASS_33 << 1);
  for (int port = startPort > 0 ? startPort : 1; port <= ETC_SERVICE_MAX_PORT;) {
    const PortSet in_use = is_traced ? PortSet() : portsInUse(servicesEntries, port);
    for (size_t offset = 0; offset < in_use.size() && port <= ETC_SERVICE_MAX_PORT;
         ++offset, ++port) {
      if (!in_use[offset] && isPortAvaliable(port)) return trace.result(port);
    }
  }
  return trace.result(-1);
}

TRACED ServicesEntry* EtcServices::getServicesEntry(const char* name) {
  TraceScope<traced::EtcServices_getServicesEntry> trace;

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "EtcServices: getServicesEntry: passed a null pointer.\n");
    return nullptr;
  }
  for (ServicesEntry* entry = servicesEntries; entry != nullptr; entry = entry->next) {
    if (strcmp(entry->name, name) == 0) return entry;
  }
  return nullptr;
}

TRACED void EtcServices::freeServicesEntries() {
  TraceScope<traced::EtcServices_freeServicesEntries> trace;

  while (servicesEntries != nullptr) {
    ServicesEntry* const head = servicesEntries;
    servicesEntries = head->next;
    free(head);
  }
}

}  // namespace VRAOSUtils
