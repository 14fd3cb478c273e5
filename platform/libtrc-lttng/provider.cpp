// Hands records to LTTng-UST. Loading it starts LTTng-UST's threads.

// LTTng-UST's read lock takes three calls through pointers for each record, unless its functions are compiled in. They
// are of ten lines at most, so that software of any licence may.
#ifndef __clang_analyzer__  // it takes the lock's variable for null after a call that sets it
#define _LGPL_SOURCE
#endif

#include "provider.h"

#include <dlfcn.h>
#include <lttng/ust-fork.h>
#include <pthread.h>
#include <signal.h>
#include <string.h>

#include <algorithm>

#include "cancellation.h"
#include "errno_saver.h"
#include "trace_numbers.h"

// Defines TRACE_TYPES and TRACE_FUNCTIONS from the tables of those names. Each function has all ids that differ from its
// own in the level.
#define TRACE_RANGE(name, id) lttng_ust_field_enum_range(name, id, (id) | trace::kLevelByte)
#include "names.h"

#define LTTNG_UST_TRACEPOINT_CREATE_PROBES
#define LTTNG_UST_TRACEPOINT_DEFINE
#include "events.h"

namespace {

// LTTng-UST must know of each fork: it would record a child as its parent, and the child's exit() would wait forever for
// threads that it does not have.
sigset_t signals_before_fork;  // LTTng-UST lets one thread fork at a time
void beforeFork() { lttng_ust_before_fork(&signals_before_fork); }
void afterForkInParent() {
  const osutils::ErrnoSaver saved_errno;
  lttng_ust_after_fork_parent(&signals_before_fork);
}
void afterForkInChild() { lttng_ust_after_fork_child(&signals_before_fork); }

__attribute__((constructor)) void followForks() {
  // With LTTng-UST's own library for it, which a program may have preloaded, it would be told twice.
  if (dlopen("liblttng-ust-fork.so.1", RTLD_LAZY | RTLD_NOLOAD) != nullptr) return;
  (void)pthread_atfork(beforeFork, afterForkInParent, afterForkInChild);
}

}  // namespace

extern "C" __attribute__((visibility("default"))) void osutils_lttng_write_record(
    uint64_t type, uint64_t id, const void* object, uint64_t length, const void* data) {
  const osutils::ErrnoSaver saved_errno;
  // LTTng-UST wakes its daemon and may wait for it in cancellation points.
  const osutils::CancellationState disabled(PTHREAD_CANCEL_DISABLE);
  if (data == nullptr || length == 0) {
    lttng_ust_tracepoint(osutils, record, type, id, object);
  } else if (int64_t code; length == sizeof code && trace::isExit(type)) {
    memcpy(&code, data, sizeof code);
    lttng_ust_tracepoint(osutils, return, type, id, object, code);
  } else {
    lttng_ust_tracepoint(osutils, message, type, id, object,
                         static_cast<uint32_t>(std::min(length, trace::kMaxTextBytes)),
                         static_cast<const char*>(data));
  }
}
