#include <dlfcn.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <iconv.h>
#include <locale.h>

#include <string>

#include "../platform/libvraldapiconv/vraldapiconv.h"

namespace {
int open_converters;
}

// The functions that the library calls. iconv_close() may change errno.
extern "C" __attribute__((visibility("default"))) iconv_t iconv_open(const char* to,
                                                                     const char* from) {
  static auto* const real = reinterpret_cast<decltype(&iconv_open)>(dlsym(RTLD_NEXT, "iconv_open"));
  const iconv_t converter = real(to, from);
  if (converter != reinterpret_cast<iconv_t>(-1)) ++open_converters;
  return converter;
}

extern "C" __attribute__((visibility("default"))) int iconv_close(iconv_t converter) {
  static auto* const real =
      reinterpret_cast<decltype(&iconv_close)>(dlsym(RTLD_NEXT, "iconv_close"));
  --open_converters;
  const int result = real(converter);
  errno = EBADF;
  return result;
}

namespace {

constexpr char kGreeting[] =
    "Gr\xc3\xbc\xc3\x9f"
    "e";  // two characters beyond ASCII

// Sets the locale of this thread until the end of the scope.
class Locale {
 public:
  explicit Locale(const char* name)
      : locale_(newlocale(LC_ALL_MASK, name, nullptr)), before_(uselocale(locale_)) {
    EXPECT_NE(locale_, nullptr) << name;
  }
  ~Locale() {
    uselocale(before_);
    freelocale(locale_);
  }
  Locale(const Locale&) = delete;
  Locale& operator=(const Locale&) = delete;

 private:
  locale_t locale_;
  locale_t before_;
};

TEST(FromUtf8, ConvertsToACodeSet) {
  char buffer[16];
  ASSERT_EQ(vraldap_from_utf8("ISO-8859-1", kGreeting, buffer, sizeof buffer), 5);
  EXPECT_STREQ(buffer,
               "Gr\xfc\xdf"
               "e");
}

TEST(FromUtf8, UsesTheCodeSetOfTheLocale) {
  char buffer[16];
  {
    const Locale utf8("C.UTF-8");
    ASSERT_EQ(vraldap_from_utf8(nullptr, kGreeting, buffer, sizeof buffer), 7);
    EXPECT_STREQ(buffer, kGreeting);
  }
  const Locale ascii("C");
  EXPECT_EQ(vraldap_from_utf8(nullptr, "plain", buffer, sizeof buffer), 5);
  EXPECT_STREQ(buffer, "plain");
  errno = 0;
  EXPECT_EQ(vraldap_from_utf8(nullptr, kGreeting, buffer, sizeof buffer), -1);
  EXPECT_EQ(errno, EILSEQ);
  EXPECT_STREQ(buffer, "");
}

TEST(FromUtf8, ReturnsACodeSetToItsInitialState) {
  char buffer[16];
  // ESC $ B, two bytes, and back to ASCII with ESC ( B.
  ASSERT_EQ(vraldap_from_utf8("ISO-2022-JP", "\xe3\x81\x82", buffer, sizeof buffer), 8);
  EXPECT_STREQ(buffer, "\x1b$B$\"\x1b(B");
  EXPECT_EQ(vraldap_from_utf8("ISO-2022-JP", "\xe3\x81\x82", buffer, 8), -1);
  EXPECT_STREQ(buffer, "");
}

TEST(FromUtf8, NeverWritesBeyondTheBuffer) {
  for (size_t size = 1; size <= 5; ++size) {
    SCOPED_TRACE(size);
    std::string buffer(8, '#');
    errno = 0;
    EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", kGreeting, buffer.data(), size), -1);
    EXPECT_EQ(errno, E2BIG);
    EXPECT_EQ(buffer[0], '\0');
    EXPECT_EQ(buffer.substr(size), std::string(8 - size, '#'));
  }
  std::string buffer(8, '#');
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", kGreeting, buffer.data(), 6), 5);
  EXPECT_EQ(buffer, std::string("Gr\xfc\xdf"
                                "e\0##",
                                8));
}

TEST(FromUtf8, AnEmptyTextNeedsOneByte) {
  char buffer = '#';
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", "", &buffer, 1), 0);
  EXPECT_EQ(buffer, '\0');
}

TEST(FromUtf8, RefusesWhatIsNotUtf8) {
  char buffer[16] = "before";
  errno = 0;
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", "a\xff", buffer, sizeof buffer), -1);
  EXPECT_EQ(errno, EILSEQ);
  EXPECT_STREQ(buffer, "");

  errno = 0;
  // The last character is incomplete.
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", "a\xc3", buffer, sizeof buffer), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_STREQ(buffer, "");
}

TEST(FromUtf8, RefusesAnUnknownCodeSet) {
  char buffer[16] = "before";
  errno = 0;
  EXPECT_EQ(vraldap_from_utf8("NO-SUCH-CODE-SET", "a", buffer, sizeof buffer), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_STREQ(buffer, "");
}

TEST(FromUtf8, RefusesNullsAndAnEmptyBuffer) {
  char buffer[2] = "#";
  const auto expectRefused = [](const char* text, char* place, size_t size) {
    errno = 0;
    EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", text, place, size), -1);
    EXPECT_EQ(errno, EINVAL);
  };
  expectRefused("a", nullptr, 2);
  expectRefused("a", buffer, 0);
  expectRefused(nullptr, buffer, 0);
  EXPECT_STREQ(buffer, "#");
  for (const size_t size : {size_t{1}, size_t{2}}) {
    buffer[0] = '#';
    expectRefused(nullptr, buffer, size);
    EXPECT_STREQ(buffer, "");
  }
}

TEST(FromUtf8, ClosesEveryConverter) {
  open_converters = 0;
  char buffer[16];
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", "a", buffer, sizeof buffer), 1);
  EXPECT_EQ(vraldap_from_utf8("ISO-8859-1", "a", buffer, 1), -1);
  EXPECT_EQ(vraldap_from_utf8("NO-SUCH-CODE-SET", "a", buffer, sizeof buffer), -1);
  EXPECT_EQ(open_converters, 0);
}

// Other libraries only need this one to load.
TEST(SharedObject, CanBeLoadedByItsPlainName) {
  void* const library = dlopen(LIBRARY_DIRECTORY "/libvraldapiconv.so", RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(library, nullptr) << dlerror();
  EXPECT_NE(dlsym(library, "vraldap_from_utf8"), nullptr);
  dlclose(library);
}

}  // namespace
