#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "ldtr.h"
#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

namespace {

// ---- Switches ----

// Checks the result of trcInit() and the mask after it, in a process with these settings.
void expectSwitched(const char* events, const char* max_bytes, bool accepted, uint64_t mask) {
  SCOPED_TRACE(std::string(events == nullptr ? "unset" : events) + " " +
               (max_bytes == nullptr ? "unset" : max_bytes));
  EXPECT_EQ(inChild([&] {
              unsetenv("TRC_DIR");
              unsetenv("TRC_EVENTS");
              unsetenv("TRC_MAX_BYTES");
              if (events != nullptr) setenv("TRC_EVENTS", events, 1);
              if (max_bytes != nullptr) setenv("TRC_MAX_BYTES", max_bytes, 1);
              trcEvents = 0x5000;
              EXPECT_EQ(trcInit() == 0, accepted);
              EXPECT_EQ(trcEvents, mask);
              return 0;
            }),
            0);
}

TEST(TrcSwitches, NamesAndNumbersSelectEvents) {
  expectSwitched("entry", nullptr, true, 0x1000);
  expectSwitched("exit_error", nullptr, true, 0x2000);
  expectSwitched("entry43", nullptr, true, 0x10000);
  expectSwitched("exit_error43", nullptr, true, 0x20000);
  expectSwitched("debug", nullptr, true, 0x4000000);
  expectSwitched("all", nullptr, true, 0x4033000);
  expectSwitched("entry,debug", nullptr, true, 0x4001000);
  expectSwitched("12288", nullptr, true, 0x3000);
  expectSwitched("0x3000", nullptr, true, 0x3000);
  expectSwitched("0xFFFFFFFFFFFFFFFF", nullptr, true, UINT64_MAX);
  expectSwitched("0", nullptr, true, 0);
  expectSwitched("0x1,entry43", nullptr, true, 0x10001);
}

TEST(TrcSwitches, EachBitOfTheMaskCanBeSetAlone) {
  for (int bit = 0; bit < 64; ++bit) {
    const uint64_t mask = uint64_t{1} << bit;
    char hexadecimal[32];
    (void)snprintf(hexadecimal, sizeof hexadecimal, "0X%lX", static_cast<unsigned long>(mask));
    expectSwitched(hexadecimal, nullptr, true, mask);
    expectSwitched(std::to_string(mask).c_str(), nullptr, true, mask);
  }
}

TEST(TrcSwitches, WithoutAValueTheMaskStays) {
  expectSwitched(nullptr, nullptr, true, 0x5000);
  expectSwitched("", nullptr, true, 0x5000);
}

TEST(TrcSwitches, ABadWordIsRefusedAndChangesNothing) {
  for (const char* const bad : {"entri", "entry,", ",entry", "entry,,debug", "entry debug", "-1",
                                "+1", "0x", "12x", " entry", "18446744073709551616", "ENTRY"}) {
    expectSwitched(bad, nullptr, false, 0x5000);
  }
  for (const char* const bad : {"many", "-1", "1K", "18446744073709551616"}) {
    expectSwitched("entry", bad, false, 0x5000);
  }
}

TEST(TrcSwitches, BitsWithoutADirectoryRecordNothing) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (chdir(temp.path().c_str()) != 0) return 1;
              unsetenv("TRC_DIR");
              setenv("TRC_EVENTS", "all", 1);
              EXPECT_EQ(trcInit(), 0);
              static std::atomic<int> opened{0};
              instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
                ++opened;
                return real::openat(directory, path, flags, mode);
              };
              traceMuch(1);
              EXPECT_EQ(opened, 0);
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

// "/" is the only directory with a name of one character.
TEST(TrcSwitches, TheRootDirectoryIsADirectory) {
  REQUIRE_ROOT("to become another user");
  EXPECT_EQ(asUser(kNobody,
                   [] {
                     EXPECT_NE(traceInto("/"), 0);
                     return 0;
                   }),
            0);
}

// What an earlier setting has left in memory does not get into a later one.
TEST(TrcSwitches, AreEachReadAfresh) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              const std::string missing = temp.path("no/such") + std::string(200, 'x');
              EXPECT_NE(traceInto(missing), 0);
              EXPECT_EQ(traceInto(temp.path("t")), 0);
              message("recorded");
              EXPECT_NE(traceInto(missing), 0);
              unsetenv("TRC_DIR");
              EXPECT_EQ(trcInit(), 0);
              message("off");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("recorded"));
  EXPECT_THAT(entries(temp.path()), SizeIs(1));
}

TEST(TrcSwitches, ADirectoryAloneCreatesNothingAtLoad) {
  const TempDir temp;
  // A program that loads the library and never calls it: this one, when it only lists its tests.
  const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=all " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_list_tests >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

// The next test runs this in a separate process with the switches set.
TEST(TrcSwitches, DISABLED_RecordsTheMask) {
  record(kEntry, kDoesFileExist, reinterpret_cast<void*>(trcEvents));
}

TEST(TrcSwitches, AreReadAtLoad) {
  const TempDir temp;
  const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=entry,debug " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_also_run_disabled_tests "
                              "--gtest_filter=TrcSwitches.DISABLED_RecordsTheMask >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  const std::vector<Event> events = readEvents(temp.path("t"));
  ASSERT_THAT(events, SizeIs(1));
  EXPECT_EQ(events[0].object, "0x4001000");
}

TEST(TrcSwitches, ARelativeDirectoryStaysWhereItWas) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (chdir(temp.path().c_str()) != 0) return 1;
              if (traceInto("t") != 0) return 2;
              if (chdir("/") != 0) return 3;
              message("found");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("found"));
}

TEST(TrcSwitches, ANewDirectoryBeginsANewTrace) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("a")) != 0) return 1;
              message("one");
              if (traceInto(temp.path("b")) != 0) return 2;
              message("two");
              if (traceInto(temp.path("b")) != 0) return 3;  // no change
              message("three");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("a"))), ElementsAre("one"));
  EXPECT_THAT(texts(readEvents(temp.path("b"))), ElementsAre("two", "three"));
  EXPECT_THAT(entries(temp.path("b")), SizeIs(1));
}

// ---- Security ----

TEST(TrcSecurity, OnlyTheOwnerCanReadATrace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              umask(0);
              if (traceInto(temp.path("t")) != 0) return 1;
              traceMuch(1);
              return 0;
            }),
            0);
  EXPECT_EQ(modeOf(temp.path("t")), 0700U);
  ASSERT_THAT(entries(temp.path("t")), SizeIs(1));
  const fs::path trace = entries(temp.path("t"))[0];
  EXPECT_EQ(modeOf(trace), 0700U);
  ASSERT_GE(entries(trace).size(), 3U);
  for (const fs::path& file : entries(trace)) EXPECT_EQ(modeOf(file), 0600U) << file;
}

TEST(TrcSecurity, ALinkInTheWayOfAFileIsNotFollowed) {
  const TempDir temp;
  const std::string victim = temp.file("victim", "untouched");
  inTracingChild(temp.path("t"), [&] {
    message("first file");
    const fs::path trace = entries(temp.path("t")).at(0);
    const fs::path file = entries(trace).at(1);
    std::string next = file.filename().string();
    next.back() = '1';
    fs::create_symlink(victim, trace / ("." + next));
    traceMuch(1);
  });
  EXPECT_EQ(contentsOf(victim), "untouched");
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.events.front().text, "first file");
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
}

TEST(TrcSecurity, AnotherDirectoryInThePlaceOfTheTraceIsNotUsed) {
  const TempDir temp;
  const std::string elsewhere = temp.dir("elsewhere");
  inTracingChild(temp.path("t"), [&] {
    message("first file");
    const fs::path trace = entries(temp.path("t")).at(0);
    fs::rename(trace, temp.path("moved"));
    fs::create_directory_symlink(elsewhere, trace);
    traceMuch(1);
    fs::remove(trace);
    fs::create_directory(trace);
    std::thread([] { message("a new thread"); }).join();
    EXPECT_THAT(entries(trace), IsEmpty());
  });
  EXPECT_THAT(entries(elsewhere), IsEmpty());
  const Reading reading = read(temp.path("moved"));
  EXPECT_EQ(reading.events.front().text, "first file");
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
}

TEST(TrcSecurity, AProgramWithMoreRightsThanItsUserIgnoresTheSwitches) {
  REQUIRE_ROOT("to make a program that runs with another group");
  const TempDir temp;
  const auto run = [&](mode_t mode) {
    const std::string program = temp.path("program");
    fs::copy_file(SECURE_PROGRAM, program, fs::copy_options::overwrite_existing);
    EXPECT_EQ(chown(program.c_str(), 0, kNobody), 0);
    EXPECT_EQ(chmod(program.c_str(), mode), 0);
    const std::string command = "TRC_DIR='" + temp.path("t") + "' TRC_EVENTS=all '" + program +
                                "' '" LIBRARY_DIRECTORY "/libtrc.so'";
    const int status = system(command.c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  };

  const int privileged = run(02755);
  if (privileged == 2) GTEST_SKIP() << "the temporary directory's mount ignores set-group-ID";
  EXPECT_EQ(privileged, 0);
  EXPECT_FALSE(pathExists(temp.path("t")));

  EXPECT_EQ(run(0755), 2);
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1));
}

}  // namespace
