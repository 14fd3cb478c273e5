#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_usergrouputils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

namespace {

TEST(UserAndGroupQueries, OtherThanThoseTwoAreTracedUnderTheFirstMaskBit) {
  const auto calls = [] {
    char name[] = "a-b";
    isValidUser(nullptr, nullptr);
    doesUserExist(nullptr);
    free(getUserHomeDir(nullptr));
    doesGroupExist(nullptr);
    isValidName(name);
  };
  {
    const Records records(kEntryExit33 | kExitError33);
    calls();
    EXPECT_THAT(
        records.trail(),
        ElementsAre("> isValidUser", "<! isValidUser 89", "> doesUserExist", "< doesUserExist 0",
                    "> getUserHomeDir", "< getUserHomeDir 0", "> doesGroupExist",
                    "< doesGroupExist 0", "> isValidName", "< isValidName 0"));
  }
  const Records records(kEntryExit43 | kExitError43);
  calls();
  EXPECT_THAT(records.trail(), IsEmpty());
}

// ---- isValidUser ----

constexpr char kSuAnn[] = "/bin/su ann -c \"exit 0\" >>/dev/null 2>>/dev/null ";

// The records, as root, up to the su command.
const Trail kAnnExists = {"> isValidUser", "> doesUserExist",
                          "D vra_getpwnam_uid: name=ann uid=1001\n", "<! doesUserExist 1",
                          "D vra_getpwnam_uid: name=root uid=0\n"};

Trail validTrail(Trail trail, const Trail& rest) {
  trail.insert(trail.end(), rest.begin(), rest.end());
  return trail;
}

TEST(ValidUser, RefusesTwoNullPointers) {
  const Records records;
  const FakeSystem shell;
  const LookUps look_ups;

  EXPECT_EQ(isValidUser(nullptr, nullptr), 89);

  EXPECT_EQ(look_ups.calls(), 0);
  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_THAT(
      records.trail(),
      ElementsAre("> isValidUser", "D isValidUser: passed a null pointer.\n", "<! isValidUser 89"));
}

TEST(ValidUser, TakesANullUserWithAnythingBesideItForAnUnknownOne) {
  const Records records;
  const FakeSystem shell;

  EXPECT_EQ(isValidUser(nullptr, ""), 32);

  EXPECT_THAT(shell.commands(), IsEmpty());
  EXPECT_THAT(records.trail(), ElementsAre("> isValidUser", "> doesUserExist",
                                           "D doesUserExist: passed a null pointer.\n",
                                           "< doesUserExist 0", "<! isValidUser 32"));
}

TEST(ValidUser, DoesNotKnowAnUnknownOrEmptyName) {
  const FakeSystem shell;
  for (const std::string user : {"nobody-here", ""}) {
    const Records records;
    EXPECT_EQ(isValidUser(user.c_str(), nullptr), 32);
    EXPECT_THAT(records.trail(), ElementsAre("> isValidUser", "> doesUserExist",
                                             "D vra_getpwnam_uid: name=" + user + " uid=-99\n",
                                             "< doesUserExist 0", "<! isValidUser 32"));
  }
  EXPECT_THAT(shell.commands(), IsEmpty());
}

TEST(ValidUser, IsTriedOutByRootWithOneShellCommand) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    for (const void* const extra :
         {static_cast<const void*>(nullptr), static_cast<const void*>("x")}) {
      const FakeSystem shell(0);
      const Records records;
      const LiveAllocations memory;

      EXPECT_EQ(isValidUser("ann", extra), 0);

      EXPECT_EQ(memory.blocks(), 0);
      EXPECT_THAT(shell.commands(), ElementsAre(kSuAnn));
      EXPECT_THAT(records.trail(),
                  ElementsAreArray(validTrail(
                      kAnnExists, {std::string("D isValidUser: command=") + kSuAnn + ".\n",
                                   "< isValidUser 0"})));
    }
  });
}

TEST(ValidUser, IsNotValidForRootWhenTheCommandFailsAndTheMessageHasTheRawStatus) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    for (const int status : {256, 1, 9, 126 << 8, 127 << 8, -1}) {
      const FakeSystem shell(status);
      const Records records;
      const LiveAllocations memory;

      EXPECT_EQ(isValidUser("ann", nullptr), 49);

      EXPECT_EQ(memory.blocks(), 0);
      EXPECT_THAT(shell.commands(), ElementsAre(kSuAnn));
      EXPECT_THAT(records.trail(),
                  ElementsAreArray(validTrail(
                      kAnnExists, {std::string("D isValidUser: command=") + kSuAnn + ".\n",
                                   "D isValidUser: command rc=" + std::to_string(status) + ".\n",
                                   "<! isValidUser 49"})));
    }
  });
}

TEST(ValidUser, IsNotValidWhenNoShellCanBeStarted) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;
    const FailingCall shell(Call::system, EAGAIN);

    EXPECT_EQ(isValidUser("ann", nullptr), 49);

    EXPECT_TRUE(shell.fired());
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_EQ(records.texts().back(), "isValidUser: command rc=-1.\n");
  });
}

TEST(ValidUser, ReportsACommandThatCannotBeBuiltAndRunsNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const FakeSystem shell;
    const Records records;
    const LiveAllocations memory;
    const FailingCall print(Call::vra_asprintf, ENOMEM);

    EXPECT_EQ(isValidUser("ann", nullptr), 80);

    EXPECT_TRUE(print.fired());
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(shell.commands(), IsEmpty());
    EXPECT_THAT(records.trail(),
                ElementsAreArray(validTrail(
                    kAnnExists, {"D isValidUser: vra_asprintf failed.\n", "<! isValidUser 80"})));
  });
}

TEST(ValidUser, TakesAPrintThatAnswersAnotherNegativeNumber) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const FakeSystem shell(0);
    const LiveAllocations memory;
    const OddPrint print(-2);

    EXPECT_EQ(isValidUser("ann", nullptr), 0);

    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(shell.commands(), ElementsAre(kSuAnn));
  });
}

TEST(ValidUser, IsAnyExistingOneForACallerOtherThanRoot) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kAnn, [] {
      const FakeSystem shell(256);
      const Records records;

      EXPECT_EQ(isValidUser("stray", nullptr), 0);
      EXPECT_EQ(isValidUser("who", nullptr), 32);

      EXPECT_THAT(shell.commands(), IsEmpty());
      EXPECT_THAT(
          records.trail(),
          ElementsAre("> isValidUser", "> doesUserExist",
                      "D vra_getpwnam_uid: name=stray uid=1002\n", "<! doesUserExist 1",
                      "D vra_getpwnam_uid: name=root uid=0\n", "< isValidUser 0", "> isValidUser",
                      "> doesUserExist", "D vra_getpwnam_uid: name=who uid=-99\n",
                      "< doesUserExist 0", "<! isValidUser 32"));
    });
  });
}

TEST(ValidUser, GoesByTheRealUserNotByTheOneTheProcessActsFor) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    {
      const FakeSystem shell(256);
      ASSERT_EQ(seteuid(kAnn), 0);
      EXPECT_EQ(isValidUser("ann", nullptr), 49);
      EXPECT_THAT(shell.commands(), ElementsAre(kSuAnn));
      ASSERT_EQ(seteuid(0), 0);
    }
    asUserExpecting(kAnn, [] {
      const FakeSystem shell(256);
      ASSERT_EQ(seteuid(0), 0);
      EXPECT_EQ(isValidUser("ann", nullptr), 0);
      EXPECT_THAT(shell.commands(), IsEmpty());
    });
  });
}

TEST(ValidUser, KnowsRootByTheNameNotByTheNumber) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const FakeSystem shell(256);
    writeFile("/etc/passwd", "toor:x:0:0::/root:/bin/sh\nann:x:1001:2001::/home/ann:/bin/sh\n");
    EXPECT_EQ(isValidUser("ann", nullptr), 0);
    EXPECT_THAT(shell.commands(), IsEmpty());

    writeFile("/etc/passwd", "root:x:1001:0::/root:/bin/sh\nann:x:1001:2001::/home/ann:/bin/sh\n");
    EXPECT_EQ(isValidUser("ann", nullptr), 0);
    EXPECT_THAT(shell.commands(), IsEmpty());
    asUserExpecting(kAnn, [] {
      const FakeSystem annsShell(256);
      EXPECT_EQ(isValidUser("ann", nullptr), 49);
      EXPECT_THAT(annsShell.commands(), ElementsAre(kSuAnn));
    });
  });
}

TEST(ValidUser, IsAnybodyWhoseLookUpCannotHaveTheMutex) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const FakeSystem shell(256);
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    EXPECT_EQ(isValidUser("who", nullptr), 49);
    EXPECT_TRUE(lock.fired());
    EXPECT_THAT(shell.commands(),
                ElementsAre("/bin/su who -c \"exit 0\" >>/dev/null 2>>/dev/null "));
  });
}

// Runs the body with the real /bin/su, whose logs stay in this process's mount namespace.
void withSu(const std::string& passwd, const std::string& shadow,
            const std::function<void()>& body) {
  withAccounts([&] {
    for (const char* const logs : {"/run", "/var/log"}) {
      ASSERT_EQ(mount("osutils-test", logs, "tmpfs", 0, "mode=0755"), 0) << logs;
    }
    writeFile("/etc/passwd", kPasswd + passwd);
    writeFile("/etc/shadow", "root:*:19000:0:99999:7:::\nann:*:19000:0:99999:7:::\n" + shadow);
    body();
  });
}

#define REQUIRE_SU() \
  if (access("/bin/su", X_OK) != 0) GTEST_SKIP() << "needs /bin/su"

TEST(ValidUser, IsOneWhoseShellSuCanRunAsThatUser) {
  REQUIRE_ACCOUNTS();
  REQUIRE_SU();
  const TempDir temp;
  const std::string seen = temp.file("seen", "");
  ASSERT_EQ(chmod(seen.c_str(), 0666), 0);
  const std::string shell = temp.file("shell", "#!/bin/sh\necho `id -u` \"$*\" >" + seen + "\n");
  ASSERT_EQ(chmod(shell.c_str(), 0755), 0);
  withSu("witness:x:1020:2001::/:" + shell + "\n", "witness:*:19000:0:99999:7:::\n", [&] {
    EXPECT_EQ(isValidUser("ann", nullptr), 0);
    EXPECT_EQ(isValidUser("root", nullptr), 0);
    EXPECT_EQ(isValidUser("witness", nullptr), 0);
  });
  EXPECT_EQ(contentsOf(seen), "1020 -c exit 0\n");
}

TEST(ValidUser, IsNotOneWhoseShellFailsOrWhomSuRefuses) {
  REQUIRE_ACCOUNTS();
  REQUIRE_SU();
  const TempDir temp;
  const std::string three = temp.file("three", "#!/bin/sh\necho out\necho err >&2\nexit 3\n");
  ASSERT_EQ(chmod(three.c_str(), 0755), 0);
  withSu(
      "locked:x:1021:2001::/:/bin/false\n"
      "three:x:1022:2001::/:" +
          three +
          "\n"
          "expired:x:1023:2001::/:/bin/sh\n",
      "locked:*:19000:0:99999:7:::\n"
      "three:*:19000:0:99999:7:::\n"
      "expired:*:19000:0:99999:7::1:\n",
      [] {
        const std::pair<const char*, const char*> refused[] = {
            {"locked", "isValidUser: command rc=256.\n"},
            {"three", "isValidUser: command rc=768.\n"},
            {"expired", "isValidUser: command rc=256.\n"},
        };
        for (const auto& [user, message] : refused) {
          SCOPED_TRACE(user);
          const Records records;
          testing::internal::CaptureStdout();
          testing::internal::CaptureStderr();
          EXPECT_EQ(isValidUser(user, nullptr), 49);
          EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
          EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
          EXPECT_EQ(records.texts().back(), message);
          EXPECT_EQ(records.exitCode(), 49);
        }
        asUserExpecting(kAnn, [] {
          EXPECT_EQ(isValidUser("locked", nullptr), 0) << "it exists; only root tries it out";
          EXPECT_EQ(isValidUser("expired", nullptr), 0);
        });
      });
}

// ---- doesUserExist, doesGroupExist ----

TEST(UserExistence, IsThatOfTheAccount) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;

    EXPECT_TRUE(doesUserExist("ann"));
    EXPECT_TRUE(doesUserExist("root"));
    EXPECT_TRUE(doesUserExist("far"));
    EXPECT_FALSE(doesUserExist("ANN")) << "the database tells case apart";
    EXPECT_FALSE(doesUserExist("staff")) << "a group";

    EXPECT_THAT(records.trail(),
                ElementsAre("> doesUserExist", "D vra_getpwnam_uid: name=ann uid=1001\n",
                            "<! doesUserExist 1",  //
                            "> doesUserExist", "D vra_getpwnam_uid: name=root uid=0\n",
                            "<! doesUserExist 1",  //
                            "> doesUserExist", "D vra_getpwnam_uid: name=far uid=-1294967296\n",
                            "<! doesUserExist 1",  //
                            "> doesUserExist", "D vra_getpwnam_uid: name=ANN uid=-99\n",
                            "< doesUserExist 0",  //
                            "> doesUserExist", "D vra_getpwnam_uid: name=staff uid=-99\n",
                            "< doesUserExist 0"));
  });
}

TEST(GroupExistence, IsThatOfTheLineInTheDatabase) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;

    EXPECT_TRUE(doesGroupExist("staff"));
    EXPECT_TRUE(doesGroupExist("root"));
    EXPECT_TRUE(doesGroupExist("far"));
    EXPECT_FALSE(doesGroupExist("STAFF")) << "the database tells case apart";
    EXPECT_FALSE(doesGroupExist("ann")) << "a user";

    EXPECT_THAT(records.trail(),
                ElementsAre("> doesGroupExist", "D vra_getgrnam_gid: name=staff gid=2001\n",
                            "<! doesGroupExist 1",  //
                            "> doesGroupExist", "D vra_getgrnam_gid: name=root gid=0\n",
                            "<! doesGroupExist 1",  //
                            "> doesGroupExist", "D vra_getgrnam_gid: name=far gid=-1294967295\n",
                            "<! doesGroupExist 1",  //
                            "> doesGroupExist", "D vra_getgrnam_gid: name=STAFF gid=-99\n",
                            "< doesGroupExist 0",  //
                            "> doesGroupExist", "D vra_getgrnam_gid: name=ann gid=-99\n",
                            "< doesGroupExist 0"));
  });
}

TEST(AccountExistence, IsDeniedToANullOrEmptyNameWithoutALookUp) {
  const Records records;
  const LookUps look_ups;

  EXPECT_FALSE(doesUserExist(nullptr));
  EXPECT_FALSE(doesUserExist(""));
  EXPECT_FALSE(doesGroupExist(nullptr));
  EXPECT_FALSE(doesGroupExist(""));

  EXPECT_EQ(look_ups.calls(), 0);
  EXPECT_THAT(
      records.trail(),
      ElementsAre("> doesUserExist", "D doesUserExist: passed a null pointer.\n",
                  "< doesUserExist 0",  //
                  "> doesUserExist", "D vra_getpwnam_uid: name= uid=-99\n", "< doesUserExist 0",
                  "> doesGroupExist", "D doesGroupExist: passed a null pointer.\n",
                  "< doesGroupExist 0",  //
                  "> doesGroupExist", "D vra_getgrnam_gid: name= gid=-99\n", "< doesGroupExist 0"));
}

TEST(AccountExistence, IsGrantedToAnyNameWhenTheMutexCannotBeLocked) {
  const Records records;
  {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    EXPECT_TRUE(doesUserExist("nobody-here"));
    EXPECT_TRUE(lock.fired());
  }
  {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    EXPECT_TRUE(doesGroupExist("nogroup-here"));
    EXPECT_TRUE(lock.fired());
  }
  EXPECT_FALSE(doesUserExist("nobody-here"));
  EXPECT_FALSE(doesGroupExist("nogroup-here"));

  EXPECT_THAT(records.trail(),
              ElementsAre("> doesUserExist", "D vra_getpwnam_uid: name=nobody-here uid=0\n",
                          "<! doesUserExist 1",  //
                          "> doesGroupExist", "D vra_getgrnam_gid: name=nogroup-here gid=0\n",
                          "<! doesGroupExist 1",  //
                          "> doesUserExist", "D vra_getpwnam_uid: name=nobody-here uid=-99\n",
                          "< doesUserExist 0",  //
                          "> doesGroupExist", "D vra_getgrnam_gid: name=nogroup-here gid=-99\n",
                          "< doesGroupExist 0"));
}

TEST(AccountExistence, IsDeniedToAnIdThatReadsAsTheNotFoundValue) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    EXPECT_FALSE(doesUserExist("minus"));
    EXPECT_FALSE(doesGroupExist("minus"));
  });
}

// ---- getUserHomeDir ----

TEST(HomeDirectory, IsThatOfTheAccountAndTheDatabaseIsClosed) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;
    std::vector<std::string> order;
    const auto note = [&](const char* what) { return [&order, what] { order.push_back(what); }; };
    const BeforeCall rewind(Call::setpwent, note("setpwent"));
    const BeforeCall lock(Call::pthread_mutex_lock, note("lock"));
    const BeforeCall look_up(Call::getpwnam, note("getpwnam"));
    const BeforeCall unlock(Call::pthread_mutex_unlock, note("unlock"));
    const BeforeCall close(Call::endpwent, note("endpwent"));

    char* const home = getUserHomeDir("ann");

    EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
    EXPECT_EQ(taken(home), "/home/ann");
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(order, ElementsAre("setpwent", "lock", "getpwnam", "unlock", "endpwent"));
    EXPECT_THAT(trailOf(records),
                ElementsAre("> getUserHomeDir", "D vra_getpwnam_homedir: name=ann dir=*\n",
                            "< getUserHomeDir 0"));
  });
}

TEST(HomeDirectory, OfTheBareBaseDirectoryGetsTheUsersNameInAnyCase) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    for (const std::string user : {"bare", "upper"}) {
      const Records records;
      const LiveAllocations memory;
      const FailingCall closes(Call::endpwent, 0, kNever);

      char* const home = getUserHomeDir(user.c_str());

      EXPECT_EQ(closes.calls(), 1);
      EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
      EXPECT_EQ(taken(home), "/home/" + user);
      EXPECT_EQ(memory.blocks(), 0);
      EXPECT_THAT(
          trailOf(records),
          ElementsAre("> getUserHomeDir", "D vra_getpwnam_homedir: name=" + user + " dir=*\n",
                      "D getUserHomeDir: Adding '" + user + "' to home dir path.\n",
                      "< getUserHomeDir 0"));
    }
  });
}

TEST(HomeDirectory, AnywhereElseIsLeftAsItIs) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    const std::pair<const char*, const char*> homes[] = {
        {"slash", "/home/"}, {"longer", "/homes"}, {"below", "/home/bare/home"},
        {"empty", ""},       {"root", "/root"},
    };
    for (const auto& [user, home] : homes) {
      const Records records;
      EXPECT_EQ(taken(getUserHomeDir(user)), home);
      EXPECT_EQ(records.texts().size(), 1U) << user;
    }
  });
}

TEST(HomeDirectory, OfANullUserIsRefusedWithTheDatabaseUntouched) {
  const Records records;
  const FailingCall rewinds(Call::setpwent, 0, kNever);
  const FailingCall closes(Call::endpwent, 0, kNever);
  const LookUps look_ups;

  EXPECT_EQ(getUserHomeDir(nullptr), nullptr);

  EXPECT_EQ(rewinds.calls() + closes.calls() + look_ups.calls(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> getUserHomeDir", "D getUserHomeDir: passed a null pointer.\n",
                          "< getUserHomeDir 0"));
}

TEST(HomeDirectory, OfAnUnknownUserSaysNoMemoryAndLeavesTheDatabaseOpen) {
  for (const std::string user : {"nobody-here", ""}) {
    const Records records;
    const FailingCall rewinds(Call::setpwent, 0, kNever);
    const FailingCall closes(Call::endpwent, 0, kNever);

    EXPECT_EQ(getUserHomeDir(user.c_str()), nullptr);

    EXPECT_EQ(rewinds.calls(), 1);
    EXPECT_EQ(closes.calls(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> getUserHomeDir", "D vra_getpwnam_homedir: name=" + user + " dir=0\n",
                            "D getUserHomeDir: ran out of memory.\n", "< getUserHomeDir 0"));
  }
}

TEST(HomeDirectory, IsNullWithoutTheMutexOrMemoryAndTheDatabaseStaysOpen) {
  const auto failing = [](Call call, int error) {
    const Records records;
    const FailingCall fault(call, error);
    const FailingCall closes(Call::endpwent, 0, kNever);
    EXPECT_EQ(getUserHomeDir("root"), nullptr);
    EXPECT_TRUE(fault.fired());
    EXPECT_EQ(closes.calls(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> getUserHomeDir", "D vra_getpwnam_homedir: name=root dir=0\n",
                            "D getUserHomeDir: ran out of memory.\n", "< getUserHomeDir 0"));
  };
  failing(Call::pthread_mutex_lock, EINVAL);
  if (!sanitizerOwnsMalloc()) failing(Call::strdup, ENOMEM);
}

TEST(HomeDirectory, ThatCannotBeBuiltIsNullAndTheDatabaseStaysOpen) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    const Records records;
    const LiveAllocations memory;
    const FailingCall print(Call::vra_asprintf, ENOMEM);
    const FailingCall closes(Call::endpwent, 0, kNever);

    EXPECT_EQ(getUserHomeDir("bare"), nullptr);

    EXPECT_TRUE(print.fired());
    EXPECT_EQ(closes.calls(), 0);
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(trailOf(records),
                ElementsAre("> getUserHomeDir", "D vra_getpwnam_homedir: name=bare dir=*\n",
                            "D getUserHomeDir: Adding 'bare' to home dir path.\n",
                            "D getUserHomeDir: vra_asprintf failed\n", "< getUserHomeDir 0"));
  });
}

TEST(HomeDirectory, TakesAPrintThatAnswersAnotherNegativeNumber) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    const LiveAllocations memory;
    const OddPrint print(-2);
    const FailingCall closes(Call::endpwent, 0, kNever);

    EXPECT_EQ(taken(getUserHomeDir("bare")), "/home/bare");

    EXPECT_EQ(closes.calls(), 1);
    EXPECT_EQ(memory.blocks(), 0);
  });
}

TEST(HomeDirectory, MakesAListingOfTheUsersBeginAgain) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const auto next_user = [] {
      const passwd* const user = getpwent();
      return std::string(user != nullptr ? user->pw_name : "(none)");
    };
    for (const std::string asked : {"ann", "who"}) {
      endpwent();  // closes the database that an earlier call left open
      EXPECT_EQ(next_user(), "root");
      EXPECT_EQ(next_user(), "ann");
      free(getUserHomeDir(asked.c_str()));
      EXPECT_EQ(next_user(), "root") << "after asking for " << asked;
    }
  });
}

TEST(UserAndGroupQueries, WriteNoMessageWithoutTheDebugBit) {
  const FakeSystem shell;
  const Records records(kAllEvents & ~kDebug);
  char name[] = "a-b";

  free(getUsersPrimaryGroup("nobody-here"));
  isMemberOfGroup("root", "nogroup-here");
  isValidUser(nullptr, nullptr);
  doesUserExist(nullptr);
  free(getUserHomeDir("nobody-here"));
  doesGroupExist(nullptr);
  isValidName(name);

  EXPECT_THAT(records.texts(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

// getUserHomeDir rewinds and closes the account database. The C library guards that with a lock that
// the thread sanitizer does not see, so the sanitizer would report a race.
#if defined(__SANITIZE_THREAD__)
constexpr bool kSeesEveryLock = false;
#elif defined(__has_feature)
constexpr bool kSeesEveryLock = !__has_feature(thread_sanitizer);
#else
constexpr bool kSeesEveryLock = true;
#endif

TEST(UserAndGroupQueries, OfEightThreadsAreAllRight) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    std::atomic<int> wrong = 0;
    const auto ask = [&wrong] {
      const auto check = [&](bool right) { wrong += right ? 0 : 1; };
      for (int round = 0; round < 50; ++round) {
        check(taken(getUsersPrimaryGroup("ann")) == "staff");
        check(taken(getUsersPrimaryGroup("far")) == "far");
        check(isMemberOfGroup("Zed", "staff"));
        check(isMemberOfGroup(nullptr, "root"));
        check(!isMemberOfGroup("stray", "choir"));
        check(!kSeesEveryLock || taken(getUserHomeDir("bare")) == "/home/bare");
        check(!kSeesEveryLock || taken(getUserHomeDir("ann")) == "/home/ann");
        check(doesUserExist("ann") && !doesUserExist("who"));
        check(doesGroupExist("music") && !doesGroupExist("who"));
      }
    };

    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) threads.emplace_back(ask);
    for (std::thread& thread : threads) thread.join();

    EXPECT_EQ(wrong, 0);
  });
}

}  // namespace
