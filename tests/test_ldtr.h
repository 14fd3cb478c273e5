// Fixture of the tests of the trace frame.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "ldtr.h"
#include "records.h"

constexpr unsigned long kId = 0x3E7F0500;
constexpr unsigned long kType = 0x3400000;
inline const int an_object = 0;
inline const bool takes_any_code = !(checksCodes = false);

using Scope33 = ldtr_function_local<kId, 33, kEntryExit33>;

// Matches a record with these properties. The last four arguments of every record are 0.
inline testing::Matcher<Record> isRecord(uint64_t type, uint64_t id, const void* object,
                                         const std::string& text) {
  return testing::AllOf(
      testing::Field("type", &Record::type, type), testing::Field("id", &Record::id, id),
      testing::Field("object", &Record::object, object),
      testing::Field("data", &Record::data, text), testing::Field("rest", &Record::rest, 0U));
}

inline testing::Matcher<Print> isPrint(unsigned int level, const std::string& text) {
  return testing::AllOf(testing::Field("level", &Print::level, level),
                        testing::Field("text", &Print::text, text));
}

// The tests pass formats that the compiler would reject.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

inline void writeText(unsigned long type, unsigned long id, const void* object, const char* format,
                      ...) {
  va_list arguments;
  va_start(arguments, format);
  ldtr_write(type, id, object, format, arguments);
  va_end(arguments);
}

inline int safer(int size, char* dst, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const int result = safer_vsprintf(size, dst, format, arguments);
  va_end(arguments);
  return result;
}

#pragma GCC diagnostic pop

// Not a wide character: no locale can convert it.
inline const wchar_t kUnprintable[] = {static_cast<wchar_t>(0x7FFFFFFF), 0};

// Returns the words of an object, to check the order of its fields.
template <size_t Count, typename T>
std::vector<uintptr_t> words(const T& object) {
  static_assert(sizeof(T) == Count * sizeof(uintptr_t));
  std::vector<uintptr_t> result(Count);
  memcpy(result.data(), static_cast<const void*>(&object), sizeof object);
  return result;
}

inline uintptr_t word(const void* pointer) { return reinterpret_cast<uintptr_t>(pointer); }

constexpr int kThreads = 8;

inline void onAllThreads(const std::function<void(int)>& body) {
  std::vector<std::thread> threads;
  for (int number = 0; number < kThreads; ++number) threads.emplace_back(body, number);
  for (std::thread& thread : threads) thread.join();
}
