#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <latch>
#include <string>
#include <thread>

#include "ldtr.h"
#include "platform.h"
#include "test_libtrc.h"
#include "world.h"

using testing::Contains;
using testing::Each;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;

namespace {

// ---- Limits and failures ----

TEST(TrcLimits, AFullFileSystemEndsTheTrace) {
  REQUIRE_ROOT("to mount a small file system");
  const TempDir temp;
  const std::string small = temp.dir("small");
  EXPECT_EQ(withPrivateMounts([&] {
              if (mount("none", small.c_str(), "tmpfs", 0, "size=1m") != 0) return 1;
              if (traceInto(small + "/t") != 0) return 2;
              message(std::string(1000, 't'));
              std::latch both_have_a_file(1);  // only a packet can tell what is missing
              std::thread other([&both_have_a_file] {
                message(std::string(1000, 't'));
                both_have_a_file.count_down();
                traceMuch(4);
              });
              both_have_a_file.wait();
              traceMuch(4);
              other.join();
              const Reading full = read(small + "/t");
              EXPECT_EQ(full.exit_status, 0) << full.errors;
              EXPECT_GT(full.events.size(), 300U);
              EXPECT_THAT(texts(full.events), Each(std::string(1000, 't')));
              EXPECT_EQ(full.events.size() + discarded(full), 8002U) << full.errors;
              for (const fs::path& path : entries(entries(small + "/t").at(0))) {
                EXPECT_FALSE(isHidden(path)) << path;
              }
              // Not even the metadata fits.
              const int filler = open((small + "/filler").c_str(), O_WRONLY | O_CREAT, 0600);
              while (write(filler, "f", 1) == 1) {
              }
              close(filler);
              const pid_t pid = fork();
              if (pid == 0) {
                message("no room");
                _exit(0);
              }
              int status = 0;
              if (waitpid(pid, &status, 0) != pid) return 3;
              EXPECT_EQ(status, 0);
              EXPECT_THAT(entries(small + "/t"), SizeIs(1));
              // Only trcInit() starts tracing again, once there is space.
              EXPECT_NE(trcInit(), 0);
              fs::remove(small + "/filler");
              message("not written either");
              EXPECT_EQ(trcInit(), 0);
              message("written");
              const Reading again = read(small + "/t");
              EXPECT_EQ(again.exit_status, 0) << again.errors;
              EXPECT_EQ(again.events.size() + discarded(again), 8004U) << again.errors;
              EXPECT_THAT(texts(again.events), Contains("written"));
              EXPECT_THAT(texts(again.events), Not(Contains("not written either")));
              EXPECT_THAT(entries(small + "/t"), SizeIs(1));
              return 0;
            }),
            0);
}

TEST(TrcLimits, ADirectoryThatCannotBeWrittenIsReportedByInitOnly) {
  REQUIRE_ROOT("to become another user");
  const TempDir temp;
  const std::string closed = temp.dir("closed");
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EXPECT_NE(traceInto(closed), 0);
                     traceMuch(1);
                     std::thread([] { traceMuch(1); }).join();
                     return 0;
                   }),
            0);
  EXPECT_THAT(entries(closed), IsEmpty());
}

TEST(TrcLimits, ADirectoryThatCannotBeMadeIsReportedByInitOnly) {
  const TempDir temp;
  const std::string file = temp.file("file", "content");
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(file), 0);
              message("nowhere");
              EXPECT_NE(traceInto(file + "/below"), 0);
              message("nowhere");
              EXPECT_NE(traceInto(temp.path("no/such")), 0);
              message("nowhere");
              EXPECT_NE(traceInto("/" + std::string(5000, 'x')), 0);
              message("nowhere");
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), SizeIs(1));
  EXPECT_EQ(contentsOf(file), "content");
}

TEST(TrcLimits, ABoundOfOneByteRecordsNothing) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(temp.path("t"), "1"), 0);
              traceMuch(1);
              std::thread([] { traceMuch(1); }).join();
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path()), IsEmpty());
}

TEST(TrcLimits, TheBoundHoldsForAllFilesOfTheProcess) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_EQ(traceInto(temp.path("t"), "1000000"), 0);
              std::atomic<int> begun{0};
              const auto trace = [&] {
                message(std::string(1000, 't'));
                for (++begun; begun < 2;)
                  usleep(100);  // both need a file to count discarded records
                traceMuch(2);
              };
              std::thread other(trace);
              trace();
              other.join();
              return 0;
            }),
            0);

  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_GT(reading.events.size(), 500U);
  EXPECT_EQ(reading.events.size() + discarded(reading), 4002U) << reading.errors;
  uintmax_t bytes = 0;
  for (const fs::path& path : entries(entries(temp.path("t")).at(0))) {
    if (path.filename() != "metadata") bytes += fs::file_size(path);
  }
  EXPECT_LE(bytes, 1'000'000U);
}

TEST(TrcLimits, ALimitOnFileSizesDoesNotEndTheProgram) {
  const TempDir temp;
  for (const rlim_t limit : {0U, 1000U, 20'000U, 100'000U}) {
    SCOPED_TRACE(limit);
    EXPECT_EQ(inChild([&] {
                if (traceInto(temp.path("t" + std::to_string(limit))) != 0) return 1;
                const rlimit small{limit, limit};
                if (setrlimit(RLIMIT_FSIZE, &small) != 0) return 2;
                traceMuch(1);
                return 0;
              }),
              0);
  }
  const Reading reading = read(temp.path("t100000"));
  EXPECT_GT(reading.events.size(), 50U);
  EXPECT_EQ(reading.events.size() + discarded(reading), 1000U) << reading.errors;
}

// ---- Restart by trcInit() ----

void limitDescriptors(rlim_t most) {
  rlimit limit;
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  limit.rlim_cur = most;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
}

TEST(TrcAgain, AFolderThatIsMadeLater) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(temp.path("later/t")), 0);
              message("no folder");
              fs::create_directory(temp.path("later"));
              message("not asked to try again");
              EXPECT_EQ(trcInit(), 0);
              message("recorded");
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("later/t"))), ElementsAre("recorded"));
}

// The next test runs this in a separate process with the switches set.
TEST(TrcAgain, DISABLED_MakesTheFolderLater) {
  const std::string root = getenv("TRC_DIR");
  const int descriptors = openDescriptors();
  message("no folder");
  EXPECT_EQ(openDescriptors(), descriptors);
  fs::create_directory(fs::path(root).parent_path());
  message("not asked to try again");
  EXPECT_EQ(trcInit(), 0);
  message("recorded");
}

TEST(TrcAgain, AFolderThatWasMissingAtLoad) {
  const TempDir temp;
  const std::string command = "TRC_DIR='" + temp.path("later/t") + "' TRC_EVENTS=debug " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_also_run_disabled_tests "
                              "--gtest_filter=TrcAgain.DISABLED_MakesTheFolderLater >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  EXPECT_THAT(texts(readEvents(temp.path("later/t"))), ElementsAre("recorded"));
}

TEST(TrcAgain, AThreadThatFoundNoDescriptor) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    std::thread([] {
      rlimit usual;
      getrlimit(RLIMIT_NOFILE, &usual);
      limitDescriptors(3);
      message("lost");
      EXPECT_NE(trcInit(), 0);
      limitDescriptors(usual.rlim_cur);
      message("lost as well");
      EXPECT_EQ(trcInit(), 0);
      message("second");
    }).join();
    message("third");
  });
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_THAT(texts(reading.events), ElementsAre("first", "second", "third"));
  EXPECT_EQ(discarded(reading), 2U) << reading.errors;
  EXPECT_THAT(entries(temp.path("t")), SizeIs(1));
}

TEST(TrcAgain, ATraceThatWasRemoved) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    fs::remove_all(temp.path("t"));
    EXPECT_EQ(trcInit(), 0);
    message("second");
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("second"));
}

TEST(TrcAgain, ABoundThatIsRaised) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t"), "100000") != 0) return 1;
              traceMuch(1);
              EXPECT_NE(trcInit(), 0);
              EXPECT_EQ(traceInto(temp.path("t"), "1000000"), 0);
              message("last");
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.events.size() + discarded(reading), 1001U) << reading.errors;
  EXPECT_EQ(reading.events.back().text, "last");
  EXPECT_THAT(entries(temp.path("t")), SizeIs(1));
}

TEST(TrcAgain, AFailureLeavesTheTraceAndTheMaskAsTheyWere) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    trcEvents = 0x1000;
    message("first");
    EXPECT_NE(traceInto(temp.path("no/such")), 0);
    setenv("TRC_EVENTS", "all", 1);
    EXPECT_NE(trcInit(), 0);
    EXPECT_EQ(trcEvents, 0x1000U);
    message("second");
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
}

TEST(TrcAgain, WithoutADirectoryTheTraceEndsUntilThereIsOne) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    unsetenv("TRC_DIR");
    EXPECT_EQ(trcInit(), 0);
    message("off");
    EXPECT_EQ(traceInto(temp.path("t")), 0);
    message("second");
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
  EXPECT_THAT(entries(temp.path("t")), SizeIs(2));
}

}  // namespace
