#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <locale.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "platform.h"
#include "signal_storm.h"
#include "world.h"

namespace {

constexpr int kDatabaseSet = 20;
constexpr int kInvalidVersion = 53;
constexpr char kBuiltIn[] = "The file /opt/db.properties holds an invalid database version.\n";

struct Printed {
  int result;
  std::string output;
  std::string error;
};

// Returns the result and the output of one call, in a process that has NLSPATH set to `nlspath`.
Printed print(const char* nlspath, int set, int number, const char* text) {
  const TempDir temp;
  const std::string output = temp.path("output");
  const std::string error = temp.path("error");
  const int result = inChild([&] {
    setenv("NLSPATH", nlspath, 1);
    EXPECT_NE(freopen(output.c_str(), "w", stdout), nullptr);
    EXPECT_NE(freopen(error.c_str(), "w", stderr), nullptr);
    const int rc = PrintMessageCmdLine(set, 1, number, 1, 1, text);
    fflush(stderr);
    return rc == -1 ? 255 : rc;
  });
  return {result, contentsOf(output), contentsOf(error)};
}

// A directory with a catalogue "osutils" made from `source`, and the NLSPATH that finds it.
class Catalogue {
 public:
  explicit Catalogue(const std::string& source) : nlspath_(temp_.path("%N.cat")) {
    const std::string command =
        "gencat '" + temp_.path("osutils.cat") + "' '" + temp_.file("source", source) + "'";
    EXPECT_EQ(system(command.c_str()), 0) << command;
  }
  const char* nlspath() const { return nlspath_.c_str(); }

 private:
  TempDir temp_;
  std::string nlspath_;
};

constexpr char kNoCatalogue[] = "/nonexistent/%N";

TEST(PrintMessage, NamesTheFileOnStandardError) {
  const Printed printed = print(kNoCatalogue, kDatabaseSet, kInvalidVersion, "/opt/db.properties");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, kBuiltIn);
  EXPECT_EQ(printed.output, "");
}

TEST(PrintMessage, FromACancelledThreadOfTheSmallestStack) {
  const Catalogue catalogue("$set 20\n53 Bad version in %s, says the catalogue.\n");
#ifdef SANITIZER_OWNS_MALLOC
  const size_t kSmallStack = 1 << 20;  // instrumented frames are larger
#else
  const size_t kSmallStack = static_cast<size_t>(PTHREAD_STACK_MIN);
#endif
  const TempDir temp;
  const std::string error = temp.file("error", "");
  EXPECT_EQ(inChild([&] {
              setenv("NLSPATH", catalogue.nlspath(), 1);
              const int descriptor = open(error.c_str(), O_WRONLY);
              if (dup2(descriptor, STDERR_FILENO) != STDERR_FILENO) return 1;
              close(descriptor);
              pthread_attr_t attributes;
              pthread_attr_init(&attributes);
              if (pthread_attr_setstacksize(&attributes, kSmallStack) != 0) return 2;
              static int answer = -2;
              pthread_t thread;
              if (pthread_create(
                      &thread, &attributes,
                      [](void*) -> void* {
                        pthread_cancel(pthread_self());
                        answer = PrintMessageCmdLine(kDatabaseSet, 1, kInvalidVersion, 1, 1, "f");
                        pthread_testcancel();
                        return nullptr;
                      },
                      nullptr) != 0) {
                return 3;
              }
              void* result = nullptr;
              pthread_join(thread, &result);
              EXPECT_EQ(result, PTHREAD_CANCELED);
              EXPECT_EQ(answer, 0);
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(error), "Bad version in f, says the catalogue.\n");
}

TEST(PrintMessage, ANullTextIsSafe) {
  const Printed printed = print(kNoCatalogue, kDatabaseSet, kInvalidVersion, nullptr);
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, "The file (null) holds an invalid database version.\n");
}

TEST(PrintMessage, AnUnknownMessageShowsItsNumbersAndText) {
  Printed printed = print(kNoCatalogue, kDatabaseSet, 54, "/opt/db.properties");
  EXPECT_EQ(printed.result, 1);
  EXPECT_EQ(printed.error, "Message 54 of set 20: /opt/db.properties\n");
  printed = print(kNoCatalogue, -1, kInvalidVersion, "");
  EXPECT_EQ(printed.result, 1);
  EXPECT_EQ(printed.error, "Message 53 of set -1: \n");
  printed = print(kNoCatalogue, INT_MIN, INT_MIN, nullptr);
  EXPECT_EQ(printed.result, 1);
  EXPECT_EQ(printed.error, "Message -2147483648 of set -2147483648: (null)\n");
}

TEST(PrintMessage, ACatalogueWins) {
  const Catalogue catalogue("$set 20\n53 In %s steht eine falsche Version.\\n\n54 Anderes: %1$s\n");
  Printed printed = print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, "/opt/db");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, "In /opt/db steht eine falsche Version.\n");
  printed = print(catalogue.nlspath(), kDatabaseSet, 54, "/opt/db");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, "Anderes: /opt/db\n");
}

TEST(PrintMessage, WhatTheCatalogueLacksIsBuiltIn) {
  const Catalogue catalogue("$set 20\n1 Another message about %s\n");
  const Printed printed =
      print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, "/opt/db.properties");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, kBuiltIn);
}

TEST(PrintMessage, ACatalogueIsNeverAFormat) {
  const Catalogue catalogue("$set 20\n53 %n%x %s %s %2$s %\n");
  const Printed printed = print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, "/opt/%n%s");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, "%n%x /opt/%n%s %s %2$s %\n");
}

TEST(PrintMessage, ACataloguedTextWithoutAPlaceForTheFileIsPassedOver) {
  const Catalogue catalogue("$set 20\n53 Something is wrong.\n");
  const Printed printed =
      print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, "/opt/db.properties");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, kBuiltIn);
}

TEST(PrintMessage, AFileThatIsNotACatalogueIsSkipped) {
  const TempDir temp;
  temp.file("osutils.cat", "not a catalogue");
  const Printed printed =
      print(temp.path("%N.cat").c_str(), kDatabaseSet, kInvalidVersion, "/opt/db.properties");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error, kBuiltIn);
}

TEST(PrintMessage, StaysOneLineAndSendsNothingToTheTerminal) {
  const Printed printed =
      print(kNoCatalogue, kDatabaseSet, kInvalidVersion,
            "/opt/a\nMessage\x1b[2J\x7f\xc2\x80\xc2\x9b\xc2\xa0\xc3\x9b\xc3\xbc\xc2");
  EXPECT_EQ(printed.result, 0);
  EXPECT_EQ(printed.error,
            "The file /opt/a?Message?[2J???\xc2\xa0\xc3\x9b\xc3\xbc\xc2 holds an invalid database "
            "version.\n");
}

// Each control character of the first 32, of the last of ASCII, and of U+0080 to U+009F; and their
// neighbours.
TEST(PrintMessage, ReplacesControlCharactersAndNothingElse) {
  const Catalogue catalogue("$set 20\n53 %s\n");
  const auto printed = [&](const std::string& text) {
    return print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, text.c_str()).error;
  };
  for (int byte = 1; byte < 0x20; ++byte) {
    const char character = static_cast<char>(byte);
    EXPECT_EQ(printed(character + std::string("x") + character + "y"), "?x?y\n") << byte;
  }
  EXPECT_EQ(printed(" ~\x7f\x80"), " ~?\x80\n");
  EXPECT_EQ(printed("\xc2\x7f \xc2\x80 \xc2\x9f \xc2\xa0"), "\xc2? ? ? \xc2\xa0\n");
  EXPECT_EQ(printed("\xc1\x80 \xc3\x9f"), "\xc1\x80 \xc3\x9f\n");
  EXPECT_EQ(printed("\xc2\xc2\x9f\xc2"), "\xc2?\xc2\n");
}

TEST(PrintMessage, NewlinesAtTheEndAreOne) {
  const Catalogue catalogue("$set 20\n53 %s\n");
  for (const char* text : {"", "\n", "\n\n"}) {
    const Printed printed = print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, text);
    EXPECT_EQ(printed.result, 0);
    EXPECT_EQ(printed.error, "\n");
  }
  EXPECT_EQ(print(catalogue.nlspath(), kDatabaseSet, kInvalidVersion, "\na\n\n").error, "?a\n");
}

// The catalogue of the locale's messages, not that of LANG.
TEST(PrintMessage, TheCatalogueIsThatOfTheLocale) {
  const TempDir temp;
  for (const char* locale : {"C.UTF-8", "another"}) {
    temp.dir(locale);
    const std::string source = temp.file("source", "$set 20\n53 " + std::string(locale) + ": %s\n");
    const std::string command =
        "gencat '" + temp.path(std::string(locale) + "/osutils.cat") + "' '" + source + "'";
    ASSERT_EQ(system(command.c_str()), 0);
  }
  const std::string error = temp.path("error");
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(setlocale(LC_MESSAGES, "C.UTF-8"), nullptr);
              setenv("LANG", "another", 1);
              setenv("NLSPATH", temp.path("%L/%N.cat").c_str(), 1);
              EXPECT_NE(freopen(error.c_str(), "w", stderr), nullptr);
              return PrintMessageCmdLine(kDatabaseSet, 1, kInvalidVersion, 1, 1, "x");
            }),
            0);
  EXPECT_EQ(contentsOf(error), "C.UTF-8: x\n");
}

TEST(PrintMessage, SaysWhenNothingCouldBePrinted) {
  for (const int number : {kInvalidVersion, 54}) {
    EXPECT_EQ(inChild([number] {
                EXPECT_NE(freopen("/dev/full", "w", stderr), nullptr);
                setvbuf(stderr, nullptr, _IONBF, 0);
                setenv("NLSPATH", kNoCatalogue, 1);
                return PrintMessageCmdLine(kDatabaseSet, 1, number, 1, 1, "text") == -1 ? 0 : 1;
              }),
              0);
  }
}

// An errno from before is not an interrupted write.
TEST(PrintMessage, AWholeLineIsNotWrittenOn) {
  EXPECT_EQ(inChild([] {
              (void)alarm(20);
              setenv("NLSPATH", kNoCatalogue, 1);
              EXPECT_NE(freopen("/dev/null", "w", stderr), nullptr);
              errno = EINTR;
              return PrintMessageCmdLine(kDatabaseSet, 1, kInvalidVersion, 1, 1, "text");
            }),
            0);
}

TEST(PrintMessage, SaysWhenThereIsNoMemory) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer's memory cannot be limited";
#endif
  EXPECT_EQ(inChild([] {
              setenv("NLSPATH", kNoCatalogue, 1);
              const std::string text(150U << 20, 'x');
              const rlimit limit = {256U << 20, 256U << 20};
              EXPECT_EQ(setrlimit(RLIMIT_AS, &limit), 0);
              for (const int number : {kInvalidVersion, 54}) {
                EXPECT_EQ(PrintMessageCmdLine(kDatabaseSet, 1, number, 1, 1, text.c_str()), -1);
              }
              return 0;
            }),
            0);
}

TEST(PrintMessage, IsWholeInASlowPipeAmidSignals) {
  for (const int flags : {0, SA_RESTART}) {
    const TempDir temp;
    const std::string received = temp.path("received");
    EXPECT_EQ(inChild([&] {
                setenv("NLSPATH", kNoCatalogue, 1);
                int ends[2];
                if (pipe(ends) != 0) return 1;
                std::string all;
                std::thread reader([&] {
                  char piece[1000];
                  for (ssize_t got; (got = read(ends[0], piece, sizeof piece)) > 0; usleep(1000)) {
                    all.append(piece, static_cast<size_t>(got));
                  }
                });
                const int kept = dup(STDERR_FILENO);
                dup2(ends[1], STDERR_FILENO);
                close(ends[1]);
                int failures = 0;
                {
                  const SignalStorm storm(flags);
                  const std::string file(3000, 'f');
                  for (int i = 0; i < 50; ++i) {
                    failures += PrintMessageCmdLine(kDatabaseSet, 1, kInvalidVersion, 1, 1,
                                                    file.c_str()) == 0
                                    ? 0
                                    : 1;
                  }
                }
                dup2(kept, STDERR_FILENO);
                reader.join();
                writeFile(received, all);
                EXPECT_EQ(failures, 0);
                EXPECT_EQ(ferror(stderr), 0);
                return 0;
              }),
              0);
    const std::string line =
        "The file " + std::string(3000, 'f') + " holds an invalid database version.\n";
    std::string expected;
    for (int i = 0; i < 50; ++i) expected += line;
    EXPECT_TRUE(contentsOf(received) == expected);
  }
}

TEST(PrintMessage, LeavesNoDescriptorOpenAndNoCatalogueMapped) {
  const Catalogue catalogue("$set 20\n53 Wrong: %s\n");
  EXPECT_EQ(inChild([&] {
              setenv("NLSPATH", catalogue.nlspath(), 1);
              EXPECT_NE(freopen("/dev/null", "w", stderr), nullptr);
              const int before = openDescriptors();
              EXPECT_EQ(PrintMessageCmdLine(kDatabaseSet, 1, kInvalidVersion, 1, 1, "x"), 0);
              EXPECT_EQ(openDescriptors(), before);
              EXPECT_THAT(contentsOf("/proc/self/maps"),
                          testing::Not(testing::HasSubstr("osutils.cat")));
              return 0;
            }),
            0);
}

}  // namespace
