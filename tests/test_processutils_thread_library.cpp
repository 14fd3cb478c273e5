#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// Runs the body in a child process whose getconf is this script.
void withGetconf(const std::string& script, const std::function<void()>& body) {
  const TempDir programs;
  program(programs, "getconf", script);
  inChildExpecting([&] {
    searchFirst(programs);
    body();
  });
}

TEST(IsNPTL, IsWhatTheMachinesOwnGetconfSays) {
  FILE* const pipe = popen("getconf GNU_LIBPTHREAD_VERSION", "r");
  ASSERT_NE(pipe, nullptr);
  char line[100] = "";
  ASSERT_NE(fgets(line, sizeof line, pipe), nullptr);
  ASSERT_EQ(pclose(pipe), 0);

  inChildExpecting([&] {
    const Records records;
    EXPECT_EQ(isNPTL(), strncmp(line, "NPTL ", 5) == 0) << line;
    EXPECT_THAT(records.trail(), IsEmpty());
  });
}

TEST(IsNPTL, AsksGetconfForTheThreadLibrary) {
  withGetconf("[ \"$*\" = GNU_LIBPTHREAD_VERSION ] && echo NPTL 2.5\n",
              [] { EXPECT_TRUE(isNPTL()); });
}

TEST(IsNPTL, LooksForTheNameInTheFirst49CharactersOfTheFirstLine) {
  const std::string filler(45, 'x');
  const std::map<std::string, bool> answers = {
      {"NPTL 2.5", true},
      {"the NPTL", true},
      {"linuxthreads-0.10", false},
      {"nptl 2.5", false},
      {"", false},
      {"linuxthreads\\nNPTL 2.5", false},
      {filler + "NPTL", true},
      {filler + "xNPTL", false},
  };
  for (const auto& [output, answer] : answers) {
    SCOPED_TRACE(output);
    withGetconf("printf '" + output + "\\n'\n",
                [expected = answer] { EXPECT_EQ(isNPTL(), expected); });
  }
}

TEST(IsNPTL, OfAGetconfThatOnlyFailsIsFalse) {
  withGetconf("exit 1\n", [] {
    const Records records;
    EXPECT_FALSE(isNPTL());
    EXPECT_THAT(records.trail(), IsEmpty());
  });
}

TEST(IsNPTL, KeepsItsFirstAnswer) {
  const TempDir place;
  const std::string answer = place.file("answer", "NPTL 2.5\n");
  const std::string other = place.file("other", "linuxthreads-0.10\n");
  for (const bool first : {true, false}) {
    SCOPED_TRACE(first);
    withGetconf("cat " + place.path("now") + "\n", [&] {
      std::filesystem::copy_file(first ? answer : other, place.path("now"),
                                 std::filesystem::copy_options::overwrite_existing);
      EXPECT_EQ(isNPTL(), first);
      std::filesystem::copy_file(first ? other : answer, place.path("now"),
                                 std::filesystem::copy_options::overwrite_existing);
      EXPECT_EQ(isNPTL(), first);
    });
  }
}

TEST(IsNPTL, LeavesItsPipeOpenOnce) {
  inChildExpecting([] {
    const int before = openDescriptors();
    const FailingCall pipes(Call::popen, 0, 1000);  // counts only

    isNPTL();
    EXPECT_EQ(openDescriptors(), before + 1);
    isNPTL();

    EXPECT_EQ(openDescriptors(), before + 1);
    EXPECT_EQ(pipes.calls(), 1);
  });
}

TEST(IsNPTL, WithoutAPipeSaysSoAndIsFalseForGood) {
  withGetconf("echo NPTL 2.5\n", [] {
    const int before = openDescriptors();
    const Records records;
    {
      const FailingCall pipe(Call::popen, EMFILE);
      EXPECT_FALSE(isNPTL());
      EXPECT_TRUE(pipe.fired());
    }
    EXPECT_FALSE(isNPTL());

    EXPECT_THAT(records.trail(), ElementsAre("E popen faild: errno=24\n"));
    EXPECT_EQ(openDescriptors(), before);
  });
}

TEST(IsNPTL, WithoutAPipeSaysNothingWhileDebugIsOff) {
  inChildExpecting([] {
    const Records records(kAllEvents & ~kDebug);
    const FailingCall pipe(Call::popen, EMFILE);
    EXPECT_FALSE(isNPTL());
    EXPECT_THAT(records.all(), IsEmpty());
  });
}

TEST(IsNPTL, OfAPipeThatCannotBeReadIsFalseForGood) {
  inChildExpecting([] {  // with the machine's getconf, because nothing waits for its end
    {
      const FailingCall read(Call::fgets, EIO);
      EXPECT_FALSE(isNPTL());
      EXPECT_TRUE(read.fired());
    }
    EXPECT_FALSE(isNPTL());
  });
}

// Interrupts the blocking calls of this process every 10 ms.
void interruptOften() {
  struct sigaction handler = {};
  handler.sa_handler = [](int) {};  // without SA_RESTART
  ASSERT_EQ(sigaction(SIGALRM, &handler, nullptr), 0);
  constexpr itimerval kEvery{{0, 10'000}, {0, 10'000}};
  ASSERT_EQ(setitimer(ITIMER_REAL, &kEvery, nullptr), 0);
}

TEST(IsNPTL, ReadsOnWhereASignalInterruptedIt) {
  withGetconf("printf 'the NP'; sleep 0.2; echo 'TL 2.5'\n", [] {
    interruptOften();
    const int before = openDescriptors();
    const FailingCall pipes(Call::popen, 0, kNever);
    const FailingCall reads(Call::fgets, 0, kNever);

    EXPECT_TRUE(isNPTL());

    EXPECT_GT(reads.calls(), 1);
    EXPECT_EQ(pipes.calls(), 1);
    EXPECT_EQ(openDescriptors(), before + 1);
  });
}

TEST(IsNPTL, OfALineThatIsCutAfterASignalIsWhatThereIs) {
  for (const bool answer : {true, false}) {
    SCOPED_TRACE(answer);
    withGetconf(std::string("printf '") + (answer ? "NPTL" : "NPT") + "'; sleep 0.2\n", [answer] {
      interruptOften();
      EXPECT_EQ(isNPTL(), answer);
    });
  }
}

TEST(IsNPTL, IsTheSameForThreadsThatAskFirstAtTheSameTime) {
  withGetconf("echo NPTL 2.5\n", [] {
    constexpr int kThreads = 8;
    std::atomic<int> ready = 0;
    std::atomic<int> yes = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back([&] {
        ++ready;
        while (ready < kThreads) std::this_thread::yield();
        if (isNPTL()) ++yes;
      });
    }
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(yes, kThreads);
  });
}

}  // namespace
