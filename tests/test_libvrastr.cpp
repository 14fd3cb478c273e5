#include <dlfcn.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <stdarg.h>
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>

#include <memory>
#include <string>

#include "platform.h"
#include "world.h"

namespace {
char kSomewhere[] = "somewhere";
bool texts_are_too_long = false;  // for vsnprintf()
}  // namespace

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

// The functions that the library calls. After a failure, what they leave in the result is undefined.
extern "C" __attribute__((visibility("default"))) int vasprintf(char** out, const char* format,
                                                                va_list arguments) {
  static auto* const real = reinterpret_cast<decltype(&vasprintf)>(dlsym(RTLD_NEXT, "vasprintf"));
  const int length = real(out, format, arguments);
  if (length < 0) *out = kSomewhere;
  return length;
}

extern "C" __attribute__((visibility("default"))) int vsnprintf(char* buffer, size_t size,
                                                                const char* format,
                                                                va_list arguments) {
  if (texts_are_too_long) {
    errno = EOVERFLOW;
    return -1;
  }
  static auto* const real = reinterpret_cast<decltype(&vsnprintf)>(dlsym(RTLD_NEXT, "vsnprintf"));
  const int length = real(buffer, size, format, arguments);
  if (length < 0 && size > 0) buffer[0] = '!';
  return length;
}

#pragma GCC diagnostic pop

namespace {

// Fills each buffer, so that a byte too many is seen.
constexpr char kUntouched = '#';

// "%ls" fails for this in the C locale, which is the initial locale of a program.
constexpr wchar_t kNoSuchCharacter[] = L"a\u00e9";

#ifdef SANITIZER_OWNS_MALLOC
constexpr bool kSanitizerOwnsMemory = true;
#else
constexpr bool kSanitizerOwnsMemory = false;
#endif

struct FreeDeleter {
  void operator()(char* memory) const { free(memory); }
};
using Text = std::unique_ptr<char, FreeDeleter>;

// Not a literal, so that the compiler does not warn.
const char* const kNullFormat = nullptr;

__attribute__((format(printf, 3, 4))) int printVa(char* buffer, size_t size, const char* format,
                                                  ...) {
  va_list arguments;
  va_start(arguments, format);
  const int length = vra_vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  return length;
}

TEST(Asprintf, MakesANewStringAndAnswersItsLength) {
  char* out = nullptr;
  ASSERT_EQ(vra_asprintf(&out, "%s=%d", "port", 389), 8);
  const Text owned(out);
  EXPECT_STREQ(out, "port=389");
}

TEST(Asprintf, AnEmptyTextIsASuccess) {
  char* out = nullptr;
  ASSERT_EQ(vra_asprintf(&out, "%s", ""), 0);
  const Text owned(out);
  EXPECT_STREQ(out, "");
}

TEST(Asprintf, HasNoLimitOfItsOwn) {
  const std::string text(1'000'000, 'x');
  char* out = nullptr;
  ASSERT_EQ(vra_asprintf(&out, "%s", text.c_str()), 1'000'000);
  const Text owned(out);
  EXPECT_EQ(out, text);
}

TEST(Asprintf, AFailedConversionIsMinusOneAndNull) {
  char* out = kSomewhere;
  EXPECT_EQ(vra_asprintf(&out, "%ls", kNoSuchCharacter), -1);
  EXPECT_EQ(out, nullptr);
}

TEST(Asprintf, WithoutMemoryItIsMinusOneAndNull) {
  if (kSanitizerOwnsMemory) GTEST_SKIP() << "a sanitizer's memory cannot be limited";
  EXPECT_EQ(inChild([] {
              const rlimit limit = {256U << 20, 256U << 20};
              EXPECT_EQ(setrlimit(RLIMIT_AS, &limit), 0);
              char* out = kSomewhere;
              EXPECT_EQ(vra_asprintf(&out, "%*d", 1 << 30, 1), -1);
              EXPECT_EQ(out, nullptr);
              return 0;
            }),
            0);
}

TEST(Asprintf, ANullFormatOrResultIsMinusOne) {
  char* out = kSomewhere;
  errno = 0;
  EXPECT_EQ(vra_asprintf(&out, kNullFormat), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(out, nullptr);
  errno = 0;
  EXPECT_EQ(vra_asprintf(nullptr, "text"), -1);
  EXPECT_EQ(errno, EINVAL);
}

TEST(Snprintf, CutsToTheBufferAndAnswersTheWholeLength) {
  struct Case {
    size_t size;
    std::string expected;  // the buffer's bytes
  };
  const Case cases[] = {
      {0, "########"},
      {1, std::string("\0#######", 8)},
      {2, std::string("1\0######", 8)},
      {5, std::string("1234\0###", 8)},
      {6, std::string("12345\0##", 8)},
      {8, std::string("12345\0##", 8)},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.size);
    std::string buffer(8, kUntouched);
    EXPECT_EQ(vra_snprintf(buffer.data(), one.size, "%d", 12345), 5);
    EXPECT_EQ(buffer, one.expected);

    buffer.assign(8, kUntouched);
    EXPECT_EQ(printVa(buffer.data(), one.size, "%d", 12345), 5);
    EXPECT_EQ(buffer, one.expected);
  }
}

TEST(Snprintf, AnEmptyTextIsASuccess) {
  for (const size_t size : {size_t{1}, size_t{8}}) {
    std::string buffer(8, kUntouched);
    EXPECT_EQ(vra_snprintf(buffer.data(), size, "%s", ""), 0);
    EXPECT_EQ(buffer, std::string("\0#######", 8));
  }
  EXPECT_EQ(vra_snprintf(nullptr, 0, "%s", ""), 0);
}

TEST(Snprintf, ANullBufferOnlyMeasures) { EXPECT_EQ(vra_snprintf(nullptr, 0, "%s", "text"), 4); }

TEST(Snprintf, TakesEverySize) {
  // 4294967284 is 8 - 20 in unsigned 32-bit arithmetic: a caller passes such a bound.
  for (const size_t size : {size_t{INT_MAX}, size_t{INT_MAX} + 1, size_t{4294967284}, SIZE_MAX}) {
    SCOPED_TRACE(size);
    // The text ends at the end of a heap block, where a sanitizer sees a byte too many.
    const auto buffer = std::make_unique<char[]>(13);
    EXPECT_EQ(vra_snprintf(buffer.get(), size, "%03d%s%02i:%02i%s", 123, "+", 1, 0, "DST"), 12);
    EXPECT_STREQ(buffer.get(), "123+01:00DST");
  }
}

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#pragma GCC diagnostic ignored "-Wformat-security"
template <typename... Arguments>
void expectTextOfTheCLibrary(const char* format, Arguments... arguments) {
  SCOPED_TRACE(format);
  constexpr size_t kBytes = 32;
  for (size_t size = 0; size <= kBytes; ++size) {
    SCOPED_TRACE(size);
    std::string expected(kBytes, kUntouched);
    std::string buffer(kBytes, kUntouched);
    const int length = snprintf(expected.data(), size, format, arguments...);
    EXPECT_EQ(vra_snprintf(buffer.data(), size, format, arguments...), length);
    EXPECT_EQ(buffer, expected);
  }
}
#pragma GCC diagnostic pop

TEST(Snprintf, MakesTheTextsOfTheCLibrary) {
  expectTextOfTheCLibrary("");
  expectTextOfTheCLibrary("text");
  expectTextOfTheCLibrary("%%");
  expectTextOfTheCLibrary("100%% of %%d");
  for (const int number : {0, 9, -10, 12345, INT_MAX, INT_MIN}) {
    expectTextOfTheCLibrary("%d", number);
    expectTextOfTheCLibrary("<%d%d>", number, number);
  }
  expectTextOfTheCLibrary("%s", "");
  expectTextOfTheCLibrary("%s%s.", "one", "two");
  expectTextOfTheCLibrary("%s is %d%% of %s\n", "1", 50, "2");
  expectTextOfTheCLibrary("%sd%ds", "s", 1);
  // These are left to the C library, also after others.
  expectTextOfTheCLibrary("%s %d %ld %s", "one", 2, 1L << 40, "four");
  expectTextOfTheCLibrary("%d%5d%-5d|", 1, 2, 3);
  expectTextOfTheCLibrary("%s%.2s%5s", "one", "two", "three");
  expectTextOfTheCLibrary("%d %u %x %c %i", -1, 1U, 255U, 'c', 7);
  expectTextOfTheCLibrary("%td", ptrdiff_t{1});
  expectTextOfTheCLibrary("%e", 2.5);
  expectTextOfTheCLibrary<const char*>("text %s", nullptr);
}

TEST(Snprintf, ATextLongerThanAnIntIsMinusOne) {
  const std::string text(256 << 20, 'x');
  const char* const part = text.c_str();
  const auto print = [part](const char* last) {
    std::string buffer(2, kUntouched);
    const int length = vra_snprintf(buffer.data(), 2, "%s%s%s%s%s%s%s%s", part, part, part, part,
                                    part, part, part, last);
    EXPECT_EQ(buffer[length == -1 ? 0 : 1], '\0');
    return length;
  };
  texts_are_too_long = true;  // the C library would take seconds to find out
  EXPECT_EQ(print(part + 1), INT_MAX);
  errno = 0;
  EXPECT_EQ(print(part), -1);
  EXPECT_EQ(errno, EOVERFLOW);
  EXPECT_EQ(vra_snprintf(nullptr, 0, "%s%s%s%s%s%s%s%s%s%s%s%s%s%s%s%s", part, part, part, part,
                         part, part, part, part, part, part, part, part, part, part, part, part),
            -1);
  texts_are_too_long = false;
}

TEST(Snprintf, AFailedConversionIsMinusOneAndTheEmptyString) {
  std::string buffer(8, kUntouched);
  EXPECT_EQ(vra_snprintf(buffer.data(), buffer.size(), "%ls", kNoSuchCharacter), -1);
  EXPECT_EQ(buffer[0], '\0');
  buffer.assign(8, kUntouched);
  EXPECT_EQ(vra_snprintf(buffer.data(), 1, "%ls", kNoSuchCharacter), -1);
  EXPECT_EQ(buffer, std::string("\0#######", 8));
  buffer.assign(8, kUntouched);
  EXPECT_EQ(vra_snprintf(buffer.data(), 0, "%ls", kNoSuchCharacter), -1);
  EXPECT_EQ(buffer, "########");
  EXPECT_EQ(vra_snprintf(nullptr, 0, "%ls", kNoSuchCharacter), -1);
}

TEST(Snprintf, NullsAreMinusOne) {
  const auto expectRefused = [](char* buffer, size_t size, bool has_format) {
    SCOPED_TRACE(size);
    errno = 0;
    EXPECT_EQ(
        has_format ? vra_snprintf(buffer, size, "text") : vra_snprintf(buffer, size, kNullFormat),
        -1);
    EXPECT_EQ(errno, EINVAL);
  };
  for (const size_t size : {size_t{1}, size_t{8}}) {
    std::string buffer(8, kUntouched);
    expectRefused(buffer.data(), size, false);
    EXPECT_EQ(buffer, std::string("\0#######", 8));
    expectRefused(nullptr, size, false);
    expectRefused(nullptr, size, true);
  }
  std::string buffer(8, kUntouched);
  expectRefused(buffer.data(), 0, false);
  EXPECT_EQ(buffer, "########");
  expectRefused(nullptr, 0, false);
}

TEST(Strlcpy, CutsToTheBufferAndAnswersTheWholeLength) {
  struct Case {
    size_t size;
    std::string expected;
  };
  const Case cases[] = {
      {0, "########"},
      {1, std::string("\0#######", 8)},
      {2, std::string("1\0######", 8)},
      {4, std::string("123\0####", 8)},
      {5, std::string("1234\0###", 8)},
      {8, std::string("1234\0###", 8)},
      {SIZE_MAX, std::string("1234\0###", 8)},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.size);
    std::string buffer(8, kUntouched);
    EXPECT_EQ(vra_strlcpy(buffer.data(), "1234", one.size), 4U);
    EXPECT_EQ(buffer, one.expected);
  }
}

TEST(Strlcpy, SourcesOfNoneAndOneCharacter) {
  std::string buffer(2, kUntouched);
  EXPECT_EQ(vra_strlcpy(buffer.data(), "", buffer.size()), 0U);
  EXPECT_EQ(buffer, std::string("\0#", 2));
  EXPECT_EQ(vra_strlcpy(buffer.data(), "1", buffer.size()), 1U);
  EXPECT_EQ(buffer, std::string("1\0", 2));
}

TEST(Strlcpy, ANullSourceIsTheEmptyString) {
  std::string buffer(2, kUntouched);
  EXPECT_EQ(vra_strlcpy(buffer.data(), nullptr, buffer.size()), 0U);
  EXPECT_EQ(buffer, std::string("\0#", 2));
}

TEST(Strlcpy, ANullDestinationIsNotWritten) { EXPECT_EQ(vra_strlcpy(nullptr, "1234", 8), 4U); }

}  // namespace
