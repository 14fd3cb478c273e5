// Captures every record and debug print of the library: this test program defines the platform
// functions itself, and its definitions win over those of the platform libraries.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

constexpr uint64_t kEntryExit33 = 0x1000;
constexpr uint64_t kExitError33 = 0x2000;
constexpr uint64_t kEntryExit43 = 0x10000;
constexpr uint64_t kExitError43 = 0x20000;
constexpr uint64_t kDebug = 0x4000000;
constexpr uint64_t kAllEvents = kEntryExit33 | kExitError33 | kEntryExit43 | kExitError43 | kDebug;

// One call of trcWriteRec.
struct Record {
  uint64_t type;
  uint64_t id;
  const void* object;
  std::string data;
  bool hasData;   // the data pointer was not null
  uint64_t rest;  // the last four arguments, or-ed
};

// One call of PrintDebugVa, formatted.
struct Print {
  unsigned int level;
  std::string text;
};

// What trcInit() answers, and how often it was called.
extern int trcInitAnswer;
extern int trcInitCalls;
// What read_ldap_debug() answers.
extern int readLdapDebugAnswer;
// Whether an exit record's code must be one that its function can record. Tests of the trace frame
// itself use the functions' numbers with any code.
extern bool checksCodes;

// Called by the platform functions that trace and print, on the thread that does so. None at first.
extern void (*atTracing)();

// Both platform functions that trace also change errno, as those of a real platform may.
constexpr int kErrnoAfterTracing = 4242;

// Switches tracing on until the end of the scope and collects what arrives, from all threads. One
// at a time. A child process made with fork() collects its own.
class Records {
 public:
  explicit Records(uint64_t events = kAllEvents);
  ~Records();
  Records(const Records&) = delete;
  Records& operator=(const Records&) = delete;

  std::vector<Record> all() const;
  std::vector<Print> prints() const;
  // The texts of the debug records in order.
  std::vector<std::string> texts() const;
  // Everything in order, one line each:
  //   "> name"        entry
  //   "< name code"   exit;  "<! name code" exit with the error record type
  //   "D text"        ordinary debug message (the newline at its end included)
  //   "E text"        error-level debug message
  // where name is the function's name in the trace table. A debug record of a scope counts only
  // with that scope's function id (an unscoped one only with its level as the id) and the record
  // type of its level, and only when the same thread's next event is an equal print with the
  // matching level: anything else gives a line that begins with "?" and says what is wrong. Which
  // scope is open is known only while the entry records of both classes are on.
  std::vector<std::string> trail() const;
  // The code of the last exit record. Fails the test when there is none.
  long exitCode() const;
  void clear();
};
