#include "ldtr.h"

#include <errno.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include "cancellation.h"
#include "errno_saver.h"
#include "platform.h"
#include "trace_numbers.h"

using osutils::CancellationState;
using osutils::ErrnoSaver;

namespace {

constexpr size_t kTextBytes = 8192;

constexpr int kTimedLock = 1;
constexpr int64_t kNanosecondsPerSecond = 1'000'000'000;
constexpr int kFirstPhaseAttempts = 300;
constexpr int64_t kFirstPhaseDelay = 100'000'000;  // nanoseconds
constexpr int kSecondPhaseAttempts = 570;
constexpr int64_t kSecondPhaseDelay = kNanosecondsPerSecond;

// sic: the texts say 30 and 60 seconds, but the second phase alone takes 570.
constexpr const char kFirstPhaseOver[] =
    "Couldn't get access to mutex controlled resource (still busy). Will wait for 30 more seconds.";
constexpr const char kSecondPhaseOver[] =
    "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)";

constexpr int kWorkingFormatCharacters = 500;
constexpr size_t kMaxFormatLength = 499;
constexpr const char kBoundedString[] = "%0.1000s";

// Tracing must not change the traced code's errno. Nor may it be a cancellation point, because a
// scope writes its exit record in a destructor.
struct TracingGuard {
  ErrnoSaver saved_errno;
  CancellationState cancellation{PTHREAD_CANCEL_DISABLE};
};

// ldtr.h is installed without trace_numbers.h, so it repeats these numbers.
static_assert(LDTR_EVENT_CLASS_33 == trace::kEvents33 &&
              LDTR_EVENT_CLASS_33 << 1 == trace::kErrorEvents33 &&
              LDTR_EVENT_CLASS_43 == trace::kEvents43 &&
              LDTR_EVENT_CLASS_43 << 1 == trace::kErrorEvents43 &&
              LDTR_EVENT_DEBUG == trace::kDebugEvents);
static_assert(ldtr_entry_type(33) == trace::kEntry33 && ldtr_entry_type(43) == trace::kEntry43 &&
              ldtr_exit_type(33) == trace::kExit33 && ldtr_exit_type(43) == trace::kExit43 &&
              ldtr_exit_error_type(33) == trace::kErrorExit33 &&
              ldtr_exit_error_type(43) == trace::kErrorExit43 && LDTR_TYPE_DEBUG == trace::kDebug &&
              LDTR_TYPE_DEBUG_ERROR == trace::kDebugError);
static_assert(LDTR_LEVEL_ORDINARY == trace::kOrdinaryLevel &&
              LDTR_LEVEL_ERROR == trace::kErrorLevel);

unsigned long withLowByte(unsigned long id, unsigned long number) {
  return id | (number & trace::kLevelByte);
}

unsigned long typeForLevel(unsigned long type, unsigned long level) {
  return level == LDTR_LEVEL_ERROR ? (type & 0xFF000000UL) | 0x70000UL : type;
}

// The platform's integers are shared by all threads without a lock.
int load(const int& shared) { return __atomic_load_n(&shared, __ATOMIC_RELAXED); }
void store(int& shared, int value) { __atomic_store_n(&shared, value, __ATOMIC_RELAXED); }

int64_t monotonicTime() {
  timespec now = {};
  (void)clock_gettime(CLOCK_MONOTONIC, &now);
  return now.tv_sec * kNanosecondsPerSecond + now.tv_nsec;
}

// Signals neither shorten nor prolong the wait. The remainder that nanosleep() stores includes the
// slack of the timer, so remainders of remainders may never come to an end.
void sleepFor(int64_t nanoseconds) {
  const int64_t end = monotonicTime() + nanoseconds;
  while (nanoseconds > 0) {
    const timespec left{nanoseconds / kNanosecondsPerSecond, nanoseconds % kNanosecondsPerSecond};
    if (nanosleep(&left, nullptr) == 0 || errno != EINTR) return;
    nanoseconds = end - monotonicTime();
  }
}

// Tries `attempts` times and sleeps after each failure.
// sic: every error except EBUSY counts as success.
bool tryLock(pthread_mutex_t* mutex, int attempts, const char* message, int64_t delay) {
  for (int attempt = 0; attempt < attempts; ++attempt) {
    if (pthread_mutex_trylock(mutex) != EBUSY) return true;
    if (ldtr_traces(LDTR_EVENT_DEBUG)) {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
      // sic: "%d" shows only the low half of the thread's handle.
      ldtr_fun(LDTR_TYPE_DEBUG)
          .debug(LDTR_LEVEL_ORDINARY, message, static_cast<int>(pthread_self()),
                 static_cast<void*>(mutex));
#pragma GCC diagnostic pop
    }
    sleepFor(delay);
  }
  return false;
}

void reportWait(const char* text) {
  if (ldtr_traces(LDTR_EVENT_DEBUG))
    ldtr_fun(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ORDINARY, "%s\n", text);
}

}  // namespace

// Constructors of other libraries may use it before dynamic initialisation.
constinit ldtr_function_global ldtr_fun;

void ldtr_write(unsigned long type, unsigned long id, const void* obj) {
  const TracingGuard guard;
  trcWriteRec(type, id, obj, 0, nullptr, 0, 0, 0, 0);
}

namespace {

__attribute__((format(printf, 4, 0))) void writeText(unsigned long type, unsigned long id,
                                                     const void* obj, const char* fmt,
                                                     va_list args) {
  char* const buffer = static_cast<char*>(calloc(kTextBytes, 1));
  const AutoFree<char> owner(buffer, free);
  if (buffer == nullptr) return;

  const int rc = vra_vsnprintf(buffer, kTextBytes, fmt, args);
  // sic: a text of exactly 8192 bytes passes and loses its last byte.
  if (static_cast<unsigned int>(rc) > kTextBytes) {
    (void)snprintf(buffer, kTextBytes,
                   "Error - ldtr_write: Debug format error - buffer is %d bytes rc=%d\n",
                   static_cast<int>(kTextBytes), rc);
  }
  trcWriteRec(type, id, obj, strlen(buffer), buffer, 0, 0, 0, 0);
}

}  // namespace

void ldtr_write(unsigned long type, unsigned long id, const void* obj, const char* fmt,
                va_list args) {
  const TracingGuard guard;
  writeText(type, id, obj, fmt, args);
}

void ldtr_exit_errcode(unsigned long id, unsigned long trace_class, unsigned long mask, long code,
                       const void* obj) {
  const TracingGuard guard;
  const bool is_error = code != 0 && ldtr_traces(mask << 1);
  trcWriteRec(is_error ? ldtr_exit_error_type(trace_class) : ldtr_exit_type(trace_class), id, obj,
              sizeof code, &code, 0, 0, 0, 0);
}

int ldtr_init() {
  const CancellationState cancellation(PTHREAD_CANCEL_DISABLE);
  return trcInit();
}

int safer_vsprintf(int size, char* dst, const char* fmt, va_list args) {
  if (dst == nullptr) return 1;
  if (size < 1) return 2;
  if (fmt == nullptr) return 3;
  const size_t fmt_length = strlen(fmt);
  if (fmt_length >= static_cast<size_t>(size)) return 5;
  if (fmt_length > kMaxFormatLength) return 6;

  char working[kWorkingFormatCharacters] = "";
  int used = 0;
  const char* copied = fmt;  // everything before it is in `working`
  for (const char* at = fmt; *at != '\0';) {
    if (at[0] != '%' || at[1] == '\0') {
      ++at;
    } else if (at[1] == '%') {
      at += 2;
    } else if (at[1] == 's') {
      const int before = static_cast<int>(at - copied);
      if (used + before + static_cast<int>(sizeof kBoundedString) > kWorkingFormatCharacters) {
        return 7;
      }
      memcpy(working + used, copied, static_cast<size_t>(before));
      used += before;
      memcpy(working + used, kBoundedString, sizeof kBoundedString - 1);
      used += static_cast<int>(sizeof kBoundedString) - 1;
      at += 2;
      copied = at;
    } else {
      ++at;
    }
  }
  const size_t tail = strlen(copied);
  if (used + static_cast<int>(tail) + 1 > kWorkingFormatCharacters) return 7;
  memcpy(working + used, copied, tail + 1);

  dst[size - 1] = '\0';
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  const int written = vsprintf(dst, working, args);
#pragma GCC diagnostic pop
  if (written < 0) return 8;
  return dst[size - 1] == '\0' ? 0 : 9;
}

// ---- ldtr_formater_local ----

void ldtr_formater_local::operator()() { ldtr_write(type_, id_, obj_); }

void ldtr_formater_local::operator()(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, id_, obj_, fmt, args);
  va_end(args);
}

void ldtr_formater_local::operator()(unsigned long sub, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, withLowByte(id_, sub), obj_, fmt, args);
  va_end(args);
}

void ldtr_formater_local::new_delete(const void* p, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, id_, p, fmt, args);
  va_end(args);
}

void ldtr_formater_local::new_delete(unsigned long sub, const void* p, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, withLowByte(id_, sub), p, fmt, args);
  va_end(args);
}

void ldtr_formater_local::debug(unsigned long level, const char* fmt, ...) {
  const TracingGuard guard;
  type_ = typeForLevel(type_, level);
  va_list args;
  va_start(args, fmt);
  writeText(type_, withLowByte(id_, level), obj_, fmt, args);
  guard.saved_errno.restore();
  va_end(args);
  va_start(args, fmt);
  PrintDebugVa(static_cast<unsigned int>(level), fmt, args);
  va_end(args);
}

// ---- ldtr_formater_global ----

void ldtr_formater_global::operator()(unsigned long id, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, id, nullptr, fmt, args);
  va_end(args);
}

void ldtr_formater_global::new_delete(unsigned long id, const void* p, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  ldtr_write(type_, id, p, fmt, args);
  va_end(args);
}

// sic: the whole level is the id; trace readers find the messages of unscoped code by it.
void ldtr_formater_global::debug(unsigned long level, const char* fmt, ...) {
  const TracingGuard guard;
  type_ = typeForLevel(type_, level);
  va_list args;
  va_start(args, fmt);
  writeText(type_, level, nullptr, fmt, args);
  guard.saved_errno.restore();
  va_end(args);
  va_start(args, fmt);
  PrintDebugVa(static_cast<unsigned int>(level), fmt, args);
  va_end(args);
}

long ldtr_function_global::SetErrorCode(long code) {
  __atomic_store_n(&ldtr_fun.code_, code, __ATOMIC_RELAXED);
  return code;
}

// ---- AutoLock ----

AutoLock::AutoLock(pthread_mutex_t* mutex, bool timed) : mutex_(mutex) {
  if (mutex_ == nullptr) return;
  if (timed) {
    const int lock_type = ReadAndSetLockType(load(default_autolock));
    store(default_autolock, lock_type);
    timed = lock_type == kTimedLock;
  }
  if (!timed) {
    (void)pthread_mutex_lock(mutex_);
    return;
  }

  if (tryLock(mutex_, kFirstPhaseAttempts, "%d failed to trylock1 %p, waiting 0.1s\n",
              kFirstPhaseDelay)) {
    return;
  }
  reportWait(kFirstPhaseOver);
  if (tryLock(mutex_, kSecondPhaseAttempts, "%d failed to trylock2 %p, waiting 1s\n",
              kSecondPhaseDelay)) {
    return;
  }
  reportWait(kSecondPhaseOver);
  throw static_cast<const char*>(kSecondPhaseOver);
}

AutoLock::~AutoLock() {
  if (mutex_ != nullptr) (void)pthread_mutex_unlock(mutex_);
}

int AutoLock::ReadAndSetLockType(int current) {
  const int readings = load(configfile_read);
  if (load(al_configfile_counter) >= readings) return current;
  store(al_configfile_counter, readings);

  char* const setting = ldap_getenv("AUTOLOCKTYPE");
  if (setting == nullptr) {
    free(setting);  // sic: only a null pointer is freed
    return kTimedLock;
  }
  // sic: leaked deliberately
  return strcmp(setting, "REGULARLOCK") == 0 ? 0 : kTimedLock;
}

// ---- AutoFree<char> ----

AutoFree<char>::AutoFree(char* p, void (*release)(void*)) : pointer_(p), release_(release) {
  (void)pthread_mutex_init(&mutex_, nullptr);
}

AutoFree<char>::~AutoFree() {
  if (pointer_ != nullptr) release_(pointer_);
  (void)pthread_mutex_destroy(&mutex_);
}

char* AutoFree<char>::get() const {
  const AutoLock lock(&mutex_, false);
  return pointer_;
}
