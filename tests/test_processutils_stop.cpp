#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <map>
#include <string>
#include <thread>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// The tests below pass 0 and negative numbers: a real signal would end more than the test.
TEST(FakeKill, KeepsEveryonesSignals) {
  const FakeKill signals(7);

  EXPECT_EQ(kill(getpid(), 0), 7);
  std::thread([] { EXPECT_EQ(kill(getppid(), 0), 7); }).join();

  EXPECT_THAT(signals.signals(),
              ElementsAre(FakeKill::Signal{getpid(), 0}, FakeKill::Signal{getppid(), 0}));
}

TEST(StopProcess, KillsTheProcessAtOnceAndNoOther) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    Other victim("victim");
    const Other bystander("bystander");
    ASSERT_GT(victim.id(), 1);
    const Records records;

    EXPECT_EQ(stopProcess(victim.text().c_str()), 0);

    const int status = victim.collect();
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
    EXPECT_TRUE(bystander.isAlive());
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "< stopProcess 0"));
  });
}

TEST(StopProcess, OfAnUnknownProcessAnswersTheFailure) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other bystander("bystander");
    const Records records;

    errno = 0;
    EXPECT_EQ(stopProcess("30000"), -1);
    EXPECT_EQ(errno, ESRCH);

    EXPECT_TRUE(bystander.isAlive());
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "<! stopProcess -1"));
  });
}

TEST(StopProcess, OfAnothersProcessAnswersTheFailure) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([] {
    const Other others("others");
    ASSERT_GT(others.id(), 1);
    EXPECT_EQ(asUser(kNobody,
                     [&] {
                       errno = 0;
                       EXPECT_EQ(stopProcess(others.text().c_str()), -1);
                       EXPECT_EQ(errno, EPERM);
                       return 0;
                     }),
              0);
    EXPECT_TRUE(others.isAlive());
  });
}

TEST(StopProcess, TakesTheNumberAtTheBeginningOfTheText) {
  const std::map<std::string, pid_t> numbers = {
      {"4711", 4711},   {" 12", 12},
      {"\t+12", 12},    {"12abc", 12},
      {"12 13", 12},    {"007", 7},
      {"0", 0},         {"", 0},
      {"abc", 0},       {"-1", -1},
      {"-4711", -4711}, {"1.5", 1},
      {"0x10", 0},      {"2147483647", 2147483647},
  };
  for (const auto& [text, number] : numbers) {
    SCOPED_TRACE(text);
    const FakeKill kill;
    const Records records;

    EXPECT_EQ(stopProcess(text.c_str()), 0);

    EXPECT_THAT(kill.signals(), ElementsAre(FakeKill::Signal{number, 9}));
    EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "< stopProcess 0"));
  }
}

TEST(StopProcess, DoesNotTryAgainAfterAFailure) {
  const FakeKill kill(-1);
  const Records records;

  EXPECT_EQ(stopProcess("abc"), -1);

  EXPECT_THAT(kill.signals(), ElementsAre(FakeKill::Signal{0, 9}));
  EXPECT_THAT(records.trail(), ElementsAre("> stopProcess", "<! stopProcess -1"));
}

TEST(StopProcess, RefusesEachMetacharacter) {
  for (const char character : kMetaCharacters) {
    SCOPED_TRACE(static_cast<int>(character));
    const std::string text = std::string("12") + character;
    const FakeKill kill;
    const Records records;

    EXPECT_EQ(stopProcess(text.c_str()), 89);

    EXPECT_THAT(kill.signals(), IsEmpty());
    EXPECT_THAT(records.trail(),
                ElementsAre("> stopProcess", "E stopProcess: A metacharacter was passed in.\n",
                            "<! stopProcess 89"));
  }
}

TEST(StopProcess, RefusesANullPointer) {
  const FakeKill kill;
  const Records records;

  EXPECT_EQ(stopProcess(nullptr), 89);

  EXPECT_THAT(kill.signals(), IsEmpty());
  EXPECT_THAT(records.trail(),
              ElementsAre("> stopProcess", "E stopProcess: A NULL pointer was passed in.\n",
                          "<! stopProcess 89"));
}

}  // namespace
