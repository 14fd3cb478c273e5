// The trace library on LTTng-UST: an LTTng session daemon decides where the records go.
//
// LTTng-UST starts threads in each program that loads it. So its part is a library of its own, the provider, which is
// loaded only if events are selected, and never in a program with more rights than its user: LTTng-UST would connect a
// program with file capabilities to the user's own daemon.
#include <dlfcn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/auxv.h>

#include <atomic>
#include <optional>

#include "cancellation.h"
#include "errno_saver.h"
#include "platform.h"
#include "provider.h"
#include "settings.h"

uint64_t trcEvents = 0;

namespace {

// Null until the provider is loaded.
std::atomic<WriteRecord> writer{nullptr};

bool hasMoreRightsThanUser() { return getauxval(AT_SECURE) != 0; }

// Loads it from the folder of this library. Returns null if it or LTTng-UST is missing.
WriteRecord loadProvider() {
  Dl_info self;
  if (dladdr(&writer, &self) == 0) return nullptr;
  char* const library = realpath(self.dli_fname, nullptr);  // it may be a link in another folder
  if (library == nullptr) return nullptr;
  const auto folder_bytes = static_cast<int>(strrchr(library, '/') + 1 - library);
  char* path = nullptr;
  const int length = asprintf(&path, "%.*s%s", folder_bytes, library, kProviderFile);
  free(library);
  if (length == -1) return nullptr;
  void* const provider = dlopen(path, RTLD_NOW | RTLD_LOCAL);
  free(path);
  if (provider == nullptr) return nullptr;
  return reinterpret_cast<WriteRecord>(dlsym(provider, kWriteRecord));
}

// Returns false if nothing can be recorded.
bool startRecording() {
  if (writer.load(std::memory_order_relaxed) == nullptr) {
    writer.store(loadProvider(), std::memory_order_release);
  }
  return writer.load(std::memory_order_relaxed) != nullptr;
}

__attribute__((constructor)) void initialize() {
  const osutils::ErrnoSaver saved_errno;
  std::optional<uint64_t> events;
  (void)trc::readEvents(events);  // an invalid value selects nothing
  if (events) trcEvents = *events;
  if (trcEvents != 0) (void)startRecording();  // there is no caller to report to
}

}  // namespace

int trcInit() {
  const osutils::ErrnoSaver saved_errno;
  const osutils::CancellationState disabled(PTHREAD_CANCEL_DISABLE);
  std::optional<uint64_t> events;
  if (!trc::readEvents(events)) return -1;
  const uint64_t wanted = events.value_or(__atomic_load_n(&trcEvents, __ATOMIC_RELAXED));
  if (wanted != 0 && !hasMoreRightsThanUser() && !startRecording()) return -1;
  if (events) __atomic_store_n(&trcEvents, wanted, __ATOMIC_RELAXED);
  return 0;
}

void trcWriteRec(uint64_t type, uint64_t id, const void* obj, uint64_t length, const void* data,
                 uint64_t, uint64_t, uint64_t, uint64_t) {
  const WriteRecord write = writer.load(std::memory_order_acquire);
  if (write != nullptr) write(type, id, obj, length, data);
}
