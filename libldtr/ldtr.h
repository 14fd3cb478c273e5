// The trace frame: scopes that leave entry, debug and exit records, a scoped lock and a scoped
// buffer.
//
// A program that opens scopes of its own also links with -ltrc: osutils-ldtr of pkg-config and
// osutils::ldtr of CMake do that. One that only calls the functions of osutils.h does not need this
// header.
//
// Rules for this header; a comment below says only what differs.
//   tracing   is switched by the bits of trcEvents. A scope's destructor tests them before it
//             writes, ldtr_exit_errcode() only to choose the record's type. Before any other call,
//             test them with ldtr_traces(): with tracing off that test is the whole cost.
//   failures  are never reported to the traced code: a record that cannot be written is left out.
//   errno     is not changed by writing a record.
//   cancel    a thread is not cancelled while a record or a message is written, whatever the
//             platform's functions do; it may be cancelled while a timed AutoLock waits.
//   threads   MT-Safe: any thread may call; scopes and formatters belong to the thread that made
//             them.
#pragma once

#if !defined(__cplusplus)
#error "ldtr.h needs C++"
#endif

#include <pthread.h>
#include <stdarg.h>
#include <stdint.h>

#define LDTR_API __attribute__((visibility("default")))
// Keeps the calls that are made only while tracing is on out of the hot part of a function.
#define LDTR_COLD __attribute__((cold))
#define LDTR_FORMAT(text, first) __attribute__((format(printf, text, first)))

// ---- The event mask ----

// The event mask of the platform trace library; may change at any time.
// Threads: MT-Safe. Read with a relaxed atomic load at each test; store it in the same way.
extern "C" uint64_t trcEvents;

// Bits of trcEvents. The bit that gives a failed exit the error record type is the mask of the
// class shifted left by one.
constexpr unsigned long LDTR_EVENT_CLASS_33 = 0x1000;   // entry and exit records of class 33
constexpr unsigned long LDTR_EVENT_CLASS_43 = 0x10000;  // entry and exit records of class 43
constexpr unsigned long LDTR_EVENT_DEBUG = 0x4000000;   // debug messages

// True if one of the given bits of trcEvents is set. Reads trcEvents at every call.
inline bool ldtr_traces(unsigned long events) {
  return __builtin_expect((__atomic_load_n(&trcEvents, __ATOMIC_RELAXED) & events) != 0, 0);
}

// ---- Record types and debug levels ----
// The type is the first number of every record.

// The type of the entry records of a trace class.
constexpr unsigned long ldtr_entry_type(unsigned long trace_class) {
  return 0x3000000UL | ((trace_class - 1) << 16);
}
// The type of the exit records of a trace class.
constexpr unsigned long ldtr_exit_type(unsigned long trace_class) {
  return 0x3000000UL | (trace_class << 16);
}
// The error type of the exit records of a trace class: that of records with a code other than 0,
// while trcEvents asks for it.
constexpr unsigned long ldtr_exit_error_type(unsigned long trace_class) {
  return 0x3000000UL | ((trace_class / 10 + 8) << 16);
}
// The types of debug records.
constexpr unsigned long LDTR_TYPE_DEBUG = 0x3400000;
constexpr unsigned long LDTR_TYPE_DEBUG_ERROR = 0x3070000;

// Debug levels. Only the error level changes the record's type.
constexpr unsigned long LDTR_LEVEL_ORDINARY = 0xC8010000;
constexpr unsigned long LDTR_LEVEL_ERROR = 0xC8110000;

// ---- Writing records ----

// Writes a record without data.
LDTR_API LDTR_COLD void ldtr_write(unsigned long type, unsigned long id, const void* obj);
// Writes a record whose data is the formatted text, without its NUL. A text of more than 8192
// bytes, or one that cannot be formatted, is replaced by a text that says so; one of exactly 8192
// bytes loses its last byte. Without memory for the text the record is left out.
LDTR_API LDTR_COLD void ldtr_write(unsigned long type, unsigned long id, const void* obj,
                                   const char* fmt, va_list args) LDTR_FORMAT(4, 0);
// Writes an exit record with `code` as its 8 bytes of data. It has the error type when `code` is
// not 0 and trcEvents has the bit `mask` << 1.
LDTR_API LDTR_COLD void ldtr_exit_errcode(unsigned long id, unsigned long trace_class,
                                          unsigned long mask, long code, const void* obj);
// Initialises the platform trace library with trcInit(). Nothing else calls it.
// Returns: what trcInit() returned.
LDTR_API int ldtr_init();

// Formats like vsprintf into the `size` bytes of `dst`, which must have room for every text that
// `fmt` can make. Only a plain "%s" is bounded: it is cut at 1000 characters.
// Returns:
//   - 0: `dst` has the text
//   - 1: `dst` is null
//   - 2: `size` is below 1
//   - 3: `fmt` is null
//   - 5: `fmt` is not shorter than `size`
//   - 6: `fmt` is longer than 499 characters
//   - 7: `fmt` with the bounds written in is longer than 499 characters
//   - 8: the formatting failed
//   - 9: the last byte of `dst` is not 0 afterwards: the text was longer
// After failure: after 9 the memory after `dst` is overwritten.
LDTR_API int safer_vsprintf(int size, char* dst, const char* fmt, va_list args) LDTR_FORMAT(3, 0);

// ---- Scopes and formatters ----

// A formatter bound to a scope: it writes records of one type with the scope's function id and
// object. "sub" numbers and levels put their low byte into the low byte of the id.
class LDTR_API ldtr_formater_local {
 public:
  ldtr_formater_local(unsigned long id, unsigned long type, const void* obj)
      : id_(id), type_(type), obj_(obj) {}

  // A record without data.
  LDTR_COLD void operator()();
  // A record with the formatted text.
  LDTR_COLD void operator()(const char* fmt, ...) LDTR_FORMAT(2, 3);
  LDTR_COLD void operator()(unsigned long sub, const char* fmt, ...) LDTR_FORMAT(3, 4);
  // A record about `p` instead of the scope's object.
  LDTR_COLD void new_delete(const void* p, const char* fmt, ...) LDTR_FORMAT(3, 4);
  LDTR_COLD void new_delete(unsigned long sub, const void* p, const char* fmt, ...)
      LDTR_FORMAT(4, 5);
  // A record with the formatted text, which then also goes to the platform's debug printer. The
  // level LDTR_LEVEL_ERROR first turns the formatter's record type into its error form.
  LDTR_COLD void debug(unsigned long level, const char* fmt, ...) LDTR_FORMAT(3, 4);

 private:
  unsigned long id_;
  unsigned long type_;
  const void* obj_;
};

// A formatter without a scope: the caller gives the record's id.
class LDTR_API ldtr_formater_global {
 public:
  explicit ldtr_formater_global(unsigned long type) : type_(type) {}

  // A record with the formatted text.
  LDTR_COLD void operator()(unsigned long id, const char* fmt, ...) LDTR_FORMAT(3, 4);
  // A record about `p`.
  LDTR_COLD void new_delete(unsigned long id, const void* p, const char* fmt, ...)
      LDTR_FORMAT(4, 5);
  // As the local formatter's, but the whole level is the record's id.
  LDTR_COLD void debug(unsigned long level, const char* fmt, ...) LDTR_FORMAT(3, 4);

 private:
  unsigned long type_;
};

// The scope of one call of a traced function. `Mask` is the class's bit of trcEvents; the
// destructor writes the exit record on every way out when that bit or the next higher one is set.
// The entry record is the function's own: if (ldtr_traces(Mask)) scope(ldtr_entry_type(Class))();
template <unsigned long Id, unsigned long Class, unsigned long Mask>
class ldtr_function_local {
 public:
  explicit ldtr_function_local(const void* obj) : code_(0), obj_(obj) {}
  ~ldtr_function_local() {
    if (ldtr_traces(Mask | (Mask << 1))) ldtr_exit_errcode(Id, Class, Mask, code_, obj_);
  }
  ldtr_function_local(const ldtr_function_local&) = delete;
  ldtr_function_local& operator=(const ldtr_function_local&) = delete;

  // A formatter for records of this type.
  ldtr_formater_local operator()(unsigned long type) { return ldtr_formater_local(Id, type, obj_); }
  // Stores the code that the exit record will carry.
  // Returns: the code.
  long SetErrorCode(long code) {
    code_ = code;
    return code;
  }

 private:
  long code_;
  const void* obj_;
};

// The scope of code that has no function id. All its users share one code, which nothing reads.
class LDTR_API ldtr_function_global {
 public:
  constexpr ldtr_function_global() : code_(0) {}

  // A formatter for records of this type.
  ldtr_formater_global operator()(unsigned long type) { return ldtr_formater_global(type); }
  // Stores into ldtr_fun, whichever object it is called on.
  // Returns: the code.
  long SetErrorCode(long code);

 private:
  long code_;
};

// The scope that all code without a function id shares.
extern LDTR_API ldtr_function_global ldtr_fun;

// ---- A scoped lock and a scoped buffer ----

// Holds a mutex for the lifetime of a scope. A null mutex is accepted and never touched.
class LDTR_API AutoLock {
 public:
  // With `timed` false, or if the process-wide lock type is not 1, waits without limit. Otherwise
  // tries 300 times at intervals of 0.1 s and then 570 times at intervals of 1 s, with a debug
  // message for each failed try. Any result of the trylock but EBUSY counts as success: the
  // destructor may then unlock a mutex that this thread does not hold.
  // After failure: throws a `const char*`.
  // Process: a timed lock stores the lock type of ReadAndSetLockType for the process.
  AutoLock(pthread_mutex_t* mutex, bool timed);
  virtual ~AutoLock();
  AutoLock(const AutoLock&) = delete;
  AutoLock& operator=(const AutoLock&) = delete;

  // The lock type to use from now on: `current` until the platform library has read its
  // configuration again, then 0 (wait without limit) if AUTOLOCKTYPE is "REGULARLOCK", else 1
  // (timed).
  // Threads: MT-Safe env. Reads and writes process-wide integers without a lock; a race only reads
  //   the setting twice.
  static int ReadAndSetLockType(int current);

 private:
  pthread_mutex_t* mutex_;
};

template <typename T>
class AutoFree;

// Owns a buffer together with the function that releases it; ownership ends only with the object.
template <>
class LDTR_API AutoFree<char> {
 public:
  // `release` must not be null unless `p` is.
  AutoFree(char* p, void (*release)(void*));
  virtual ~AutoFree();
  AutoFree(const AutoFree&) = delete;
  AutoFree& operator=(const AutoFree&) = delete;

  // The owned pointer, read under the object's own mutex.
  char* get() const;

 private:
  char* pointer_;
  void (*release_)(void*);
  mutable pthread_mutex_t mutex_;
};
