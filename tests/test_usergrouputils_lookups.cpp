#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <stdlib.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_usergrouputils.h"
#include "trails.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr int kFarAsInt = -1294967296;

// Formats a pointer as "%d" does.
std::string asNumber(const void* pointer) {
  return std::to_string(static_cast<int>(reinterpret_cast<intptr_t>(pointer)));
}

// ---- Look-ups ----

TEST(AccountLookUps, FindWhatTheDatabaseHas) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    EXPECT_EQ(vra_getpwnam_uid("root"), 0);
    EXPECT_EQ(vra_getpwnam_uid("ann"), 1001);
    EXPECT_EQ(vra_getgrnam_gid("root"), 0);
    EXPECT_EQ(vra_getgrnam_gid("music"), 2002);
    EXPECT_EQ(taken(vra_getpwnam_homedir("ann")), "/home/ann");
    EXPECT_THAT(taken(vra_getgrnam_mem("staff")), ElementsAre("zed", "ann", "bob"));
    EXPECT_EQ(vra_get_uid("ann"), 1001);
    EXPECT_EQ(vra_get_usr_gid("ann"), 2001);
    EXPECT_EQ(taken(vra_get_usr_name("ann")), "ann");
    EXPECT_EQ(vra_getgrgid_gid(kStaff), 2001);
    EXPECT_EQ(taken(vra_getgrgid_name(kStaff)), "staff");
  });
}

TEST(AccountLookUps, OfWhatTheDatabaseDoesNotHave) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    EXPECT_EQ(vra_getpwnam_uid("nobody-here"), -99);
    EXPECT_EQ(vra_getgrnam_gid("nobody-here"), -99);
    EXPECT_EQ(vra_getpwnam_homedir("nobody-here"), nullptr);
    EXPECT_EQ(vra_getgrnam_mem("nobody-here"), nullptr);
    EXPECT_EQ(vra_get_uid("nobody-here"), -99);
    EXPECT_EQ(vra_get_usr_gid("nobody-here"), -99);
    EXPECT_EQ(vra_get_usr_name("nobody-here"), nullptr);
    EXPECT_EQ(vra_getgrgid_gid(2999), -99);
    EXPECT_EQ(vra_getgrgid_name(2999), nullptr);
  });
}

TEST(AccountLookUps, ShowAnIdBeyondIntAsItsNegativeCounterpart) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;

    EXPECT_EQ(vra_getpwnam_uid("far"), kFarAsInt);
    EXPECT_EQ(vra_get_uid("far"), kFarAsInt);
    EXPECT_EQ(vra_get_usr_gid("far"), kFarAsInt + 1);
    EXPECT_EQ(vra_getgrnam_gid("far"), kFarAsInt + 1);
    EXPECT_EQ(vra_getgrgid_gid(kFar + 1), kFarAsInt + 1);
    EXPECT_EQ(taken(vra_getgrgid_name(kFar + 1)), "far");

    const std::vector<std::string> trail = records.trail();
    ASSERT_EQ(trail.size(), 6U);
    EXPECT_EQ(trail[0], "D vra_getpwnam_uid: name=far uid=-1294967296\n");
    EXPECT_EQ(trail[4], "D vra_getgrgid_gid: gid=-1294967295 ret_gid=-1294967295\n");
  });
}

TEST(AccountLookUps, LeaveOneMessageEachAndNoEntryOrExit) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;

    vra_getpwnam_uid("ann");
    vra_getgrnam_gid("staff");
    char* const home = vra_getpwnam_homedir("ann");
    char** const members = vra_getgrnam_mem("staff");
    vra_get_uid("ann");
    vra_get_usr_gid("ann");
    char* const user = vra_get_usr_name("ann");
    vra_getgrgid_gid(kStaff);
    char* const group = vra_getgrgid_name(kStaff);

    EXPECT_THAT(
        records.trail(),
        ElementsAre("D vra_getpwnam_uid: name=ann uid=1001\n",
                    "D vra_getgrnam_gid: name=staff gid=2001\n",
                    "D vra_getpwnam_homedir: name=ann dir=" + asNumber(home) + "\n",
                    "D ldap_getgrnam_mem: name=staff ret_grpList=" + asNumber(members) + "\n",
                    "D vra_get_uid: name=ann uid=1001\n", "D vra_get_usr_gid: name=ann gid=2001\n",
                    "D vra_get_usr_name: name=ann ret_name=" + asNumber(user) + "\n",
                    "D vra_getgrgid_gid: gid=2001 ret_gid=2001\n",
                    "D vra_getgrgid_name: gid=2001 ret_name=" + asNumber(group) + "\n"));
    taken(home);
    taken(members);
    taken(user);
    taken(group);
  });
}

TEST(AccountLookUps, SayInTheirMessageThatNothingWasFound) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;

    vra_getpwnam_uid("who");
    vra_getgrnam_gid("who");
    vra_getpwnam_homedir("who");
    vra_getgrnam_mem("who");
    vra_get_uid("who");
    vra_get_usr_gid("who");
    vra_get_usr_name("who");
    vra_getgrgid_gid(2999);
    vra_getgrgid_name(2999);

    EXPECT_THAT(records.trail(), ElementsAre("D vra_getpwnam_uid: name=who uid=-99\n",
                                             "D vra_getgrnam_gid: name=who gid=-99\n",
                                             "D vra_getpwnam_homedir: name=who dir=0\n",
                                             "D ldap_getgrnam_mem: name=who ret_grpList=0\n",
                                             "D vra_get_uid: name=who uid=-99\n",
                                             "D vra_get_usr_gid: name=who gid=-99\n",
                                             "D vra_get_usr_name: name=who ret_name=0\n",
                                             "D vra_getgrgid_gid: gid=2999 ret_gid=-99\n",
                                             "D vra_getgrgid_name: gid=2999 ret_name=0\n"));
  });
}

TEST(AccountLookUps, WriteNothingWithoutTheDebugBit) {
  const Records records(kAllEvents & ~kDebug);

  EXPECT_EQ(vra_getpwnam_uid("root"), 0);

  EXPECT_THAT(records.trail(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(AccountLookUps, RefuseANullOrEmptyNameWithoutAskingTheDatabase) {
  const Records records;
  const FailingCall users(Call::getpwnam, 0, kNever);
  const FailingCall groups(Call::getgrnam, 0, kNever);

  for (const char* const refused : {static_cast<const char*>(nullptr), ""}) {
    EXPECT_EQ(vra_getpwnam_uid(refused), -99);
    EXPECT_EQ(vra_getgrnam_gid(refused), -99);
    EXPECT_EQ(vra_getgrnam_mem(refused), nullptr);
  }

  EXPECT_EQ(users.calls(), 0);
  EXPECT_EQ(groups.calls(), 0);
  EXPECT_THAT(records.trail(), ElementsAre("D vra_getpwnam_uid: name=NULL uid=-99\n",
                                           "D vra_getgrnam_gid: name=NULL gid=-99\n",
                                           "D ldap_getgrnam_mem: name=NULL ret_grpList=0\n",
                                           "D vra_getpwnam_uid: name= uid=-99\n",
                                           "D vra_getgrnam_gid: name= gid=-99\n",
                                           "D ldap_getgrnam_mem: name= ret_grpList=0\n"));
}

TEST(AccountLookUps, PassAnEmptyNameOnWhereItIsNotRefused) {
  const Records records;
  const FailingCall users(Call::getpwnam, 0, kNever);

  EXPECT_EQ(vra_getpwnam_homedir(""), nullptr);
  EXPECT_EQ(vra_get_uid(""), -99);
  EXPECT_EQ(vra_get_usr_gid(""), -99);
  EXPECT_EQ(vra_get_usr_name(""), nullptr);

  EXPECT_EQ(users.calls(), 4);
  EXPECT_THAT(
      records.trail(),
      ElementsAre("D vra_getpwnam_homedir: name= dir=0\n", "D vra_get_uid: name= uid=-99\n",
                  "D vra_get_usr_gid: name= gid=-99\n", "D vra_get_usr_name: name= ret_name=0\n"));
}

TEST(AccountLookUps, DoNotRefuseANullNameForTheHomeDirectory) {
  const Records records;
  // A null name that was refused would not reach the mutex. The mutex fails: otherwise the database
  // would dereference the name.
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL);

  EXPECT_EQ(vra_getpwnam_homedir(nullptr), nullptr);

  EXPECT_TRUE(lock.fired());
  EXPECT_THAT(records.trail(), ElementsAre("D vra_getpwnam_homedir: name=NULL dir=0\n"));
}

TEST(AccountLookUps, TakeANullNameForTheUserOfTheProcess) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kAnn, [] {
      const Records records;
      const FailingCall by_name(Call::getpwnam, 0, kNever);
      const FailingCall by_uid(Call::getpwuid, 0, kNever);

      EXPECT_EQ(vra_get_uid(nullptr), 1001);
      EXPECT_EQ(vra_get_usr_gid(nullptr), 2001);
      char* const name = vra_get_usr_name(nullptr);

      EXPECT_EQ(by_name.calls(), 0);
      EXPECT_EQ(by_uid.calls(), 3);
      EXPECT_THAT(records.trail(),
                  ElementsAre("D vra_get_uid: name=NULL uid=1001\n",
                              "D vra_get_usr_gid: name=NULL gid=2001\n",
                              "D vra_get_usr_name: name=NULL ret_name=" + asNumber(name) + "\n"));
      EXPECT_EQ(taken(name), "ann");
    });
  });
}

TEST(AccountLookUps, OfTheProcessGoByItsRealUserNotByTheOneItActsFor) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    ASSERT_EQ(seteuid(kAnn), 0);
    EXPECT_EQ(vra_get_uid(nullptr), 0);
    EXPECT_EQ(vra_get_usr_gid(nullptr), 0);
    EXPECT_EQ(taken(vra_get_usr_name(nullptr)), "root");
    ASSERT_EQ(seteuid(0), 0);
  });
}

TEST(AccountLookUps, OfAProcessWhoseUserHasNoAccount) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kUnknown, [] {
      EXPECT_EQ(vra_get_uid(nullptr), -99);
      EXPECT_EQ(vra_get_usr_gid(nullptr), -99);
      EXPECT_EQ(vra_get_usr_name(nullptr), nullptr);
    });
  });
}

TEST(AccountLookUps, TakeTheGidThatTheDatabaseReports) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    EXPECT_EQ(vra_get_usr_gid("stray"), 2999);  // even if that group does not exist
    EXPECT_EQ(vra_getgrgid_gid(2999), -99);
  });
}

TEST(GroupMembers, OfAGroupWithoutMembersAreAListOfTheEndAlone) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    char** const members = vra_getgrnam_mem("music");
    ASSERT_NE(members, nullptr);
    EXPECT_EQ(members[0], nullptr);
    free(static_cast<void*>(members));
  });
}

TEST(GroupMembers, ComeInTheOrderOfTheDatabaseHoweverMany) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const std::vector<std::string> members = taken(vra_getgrnam_mem("many"));
    ASSERT_EQ(members.size(), static_cast<size_t>(kManyMembers));
    for (int i = 0; i < kManyMembers; ++i) {
      ASSERT_EQ(members[static_cast<size_t>(i)], "member" + std::to_string(i));
    }
  });
}

// ---- Failures inside a look-up ----

TEST(AccountLookUps, AnswerWithoutTheDatabaseWhenTheMutexCannotBeLocked) {
  const auto unlockable = [](const std::function<void()>& look_up) {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    const FailingCall unlock(Call::pthread_mutex_unlock, 0, kNever);
    const FailingCall by_name(Call::getpwnam, 0, kNever);
    const FailingCall by_uid(Call::getpwuid, 0, kNever);
    const FailingCall group_by_name(Call::getgrnam, 0, kNever);
    const FailingCall group_by_gid(Call::getgrgid, 0, kNever);
    look_up();
    EXPECT_TRUE(lock.fired());
    EXPECT_EQ(unlock.calls(), 0);
    EXPECT_EQ(by_name.calls() + by_uid.calls() + group_by_name.calls() + group_by_gid.calls(), 0);
  };

  unlockable([] { EXPECT_EQ(vra_getpwnam_uid("root"), 0); });
  unlockable([] { EXPECT_EQ(vra_getpwnam_uid("nobody-here"), 0); });
  unlockable([] { EXPECT_EQ(vra_getgrnam_gid("nobody-here"), 0); });
  unlockable([] { EXPECT_EQ(vra_getpwnam_homedir("root"), nullptr); });
  unlockable([] { EXPECT_EQ(vra_getgrnam_mem("root"), nullptr); });
  unlockable([] { EXPECT_EQ(vra_get_uid("root"), -99); });
  unlockable([] { EXPECT_EQ(vra_get_uid(nullptr), -99); });
  unlockable([] { EXPECT_EQ(vra_get_usr_gid("root"), -99); });
  unlockable([] { EXPECT_EQ(vra_get_usr_name("root"), nullptr); });
  unlockable([] { EXPECT_EQ(vra_getgrgid_gid(4242), 0); });
  unlockable([] { EXPECT_EQ(vra_getgrgid_name(0), nullptr); });

  EXPECT_EQ(vra_getpwnam_uid("root"), 0) << "the mutex serves again";
  EXPECT_EQ(vra_get_uid("nobody-here"), -99);
}

TEST(AccountLookUps, SayWhatTheyAnswerWithoutTheMutex) {
  const Records records;
  {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    vra_getpwnam_uid("somebody");
    ASSERT_TRUE(lock.fired());
  }
  {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    vra_get_uid(nullptr);
    ASSERT_TRUE(lock.fired());
  }

  EXPECT_THAT(records.trail(), ElementsAre("D vra_getpwnam_uid: name=somebody uid=0\n",
                                           "D vra_get_uid: name=NULL uid=-99\n"));
}

TEST(AccountLookUps, CopyUnderTheMutexAndWriteTheMessageAfterIt) {
  const Records records;
  std::vector<std::string> order;
  const auto note = [&](const char* what) { return [&order, what] { order.push_back(what); }; };
  const BeforeCall lock(Call::pthread_mutex_lock, note("lock"));
  const BeforeCall look_up(Call::getpwnam, note("getpwnam"));
  const BeforeCall copy(Call::strdup, note("strdup"));
  const BeforeCall unlock(Call::pthread_mutex_unlock, note("unlock"));
  const BeforeCall message(Call::vra_vsnprintf, note("message"));

  EXPECT_EQ(taken(vra_get_usr_name("root")), "root");

  if (sanitizerOwnsMalloc()) {
    EXPECT_THAT(order, ElementsAre("lock", "getpwnam", "unlock", "message"));
  } else {
    EXPECT_THAT(order, ElementsAre("lock", "getpwnam", "strdup", "unlock", "message"));
  }
}

TEST(AccountLookUps, AnswerNullWhenTheCopyOfAStringFails) {
  REQUIRE_OWN_MALLOC();
  const auto without_memory = [](const std::function<char*()>& look_up) {
    const FailingCall copy(Call::strdup, ENOMEM);
    EXPECT_EQ(look_up(), nullptr);
    EXPECT_TRUE(copy.fired());
  };

  without_memory([] { return vra_getpwnam_homedir("root"); });
  without_memory([] { return vra_get_usr_name("root"); });
  without_memory([] { return vra_getgrgid_name(0); });

  EXPECT_EQ(taken(vra_get_usr_name("root")), "root") << "the mutex was released";
}

TEST(GroupMembers, AreAllThereOrNoneWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    int nth = 1;
    for (;; ++nth) {
      SCOPED_TRACE(nth);
      const LiveAllocations memory;
      FailingCall allocation(Call::allocation, ENOMEM, nth);
      char** const members = vra_getgrnam_mem("staff");
      allocation.disarm();
      if (!allocation.fired()) {
        EXPECT_EQ(memory.blocks(), 4);
        EXPECT_THAT(taken(members), ElementsAre("zed", "ann", "bob"));
        EXPECT_EQ(memory.blocks(), 0);
        break;
      }
      EXPECT_EQ(members, nullptr);
      EXPECT_EQ(memory.blocks(), 0);
    }
    EXPECT_EQ(nth, 5) << "one list and three names";
  });
}

TEST(AccountLookUps, OfEightThreadsAreAllRight) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const auto look_up = [](std::atomic<int>* wrong) {
      const auto check = [&](bool right) { *wrong += right ? 0 : 1; };
      for (int round = 0; round < 100; ++round) {
        check(vra_getpwnam_uid("ann") == 1001);
        check(vra_getgrnam_gid("music") == 2002);
        check(taken(vra_getpwnam_homedir("stray")) == "/home/stray");
        check(taken(vra_getgrnam_mem("staff")) == std::vector<std::string>{"zed", "ann", "bob"});
        check(vra_get_uid("far") == kFarAsInt);
        check(vra_get_uid(nullptr) == 0);
        check(vra_get_usr_gid("stray") == 2999);
        check(taken(vra_get_usr_name("ann")) == "ann");
        check(vra_getgrgid_gid(kMusic) == 2002);
        check(taken(vra_getgrgid_name(kStaff)) == "staff");
        check(vra_getpwnam_uid("nobody-here") == -99);
      }
    };

    std::atomic<int> wrong = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) threads.emplace_back(look_up, &wrong);
    for (std::thread& thread : threads) thread.join();

    EXPECT_EQ(wrong, 0);
  });
}

}  // namespace
