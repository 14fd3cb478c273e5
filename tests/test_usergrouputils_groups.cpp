#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_usergrouputils.h"
#include "trails.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

// ---- getUsersPrimaryGroup ----

TEST(PrimaryGroup, IsTheOneOfTheUsersAccount) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;

    char* const group = getUsersPrimaryGroup("ann");

    EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1);
    EXPECT_EQ(taken(group), "staff");
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(
        trailOf(records),
        ElementsAre("> getUsersPrimaryGroup", "D vra_get_usr_gid: name=ann gid=2001\n",
                    "D vra_getgrgid_name: gid=2001 ret_name=*\n", "< getUsersPrimaryGroup 0"));
  });
}

TEST(PrimaryGroup, OfANullUserIsThatOfTheProcessesRealUser) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kAnn, [] {
      const Records records;
      EXPECT_EQ(taken(getUsersPrimaryGroup(nullptr)), "staff");
      EXPECT_THAT(
          trailOf(records),
          ElementsAre("> getUsersPrimaryGroup", "D vra_get_usr_gid: name=NULL gid=2001\n",
                      "D vra_getgrgid_name: gid=2001 ret_name=*\n", "< getUsersPrimaryGroup 0"));
      ASSERT_EQ(seteuid(0), 0);
      EXPECT_EQ(taken(getUsersPrimaryGroup(nullptr)), "staff") << "acting for root";
    });
  });
}

TEST(PrimaryGroup, HasAnIdBeyondInt) {
  REQUIRE_ACCOUNTS();
  withAccounts([] { EXPECT_EQ(taken(getUsersPrimaryGroup("far")), "far"); });
}

TEST(PrimaryGroup, OfAnUnknownUserIsNullAndNoGroupIsLookedUp) {
  const Records records;
  const FailingCall groups(Call::getgrgid, 0, kNever);

  EXPECT_EQ(getUsersPrimaryGroup("nobody-here"), nullptr);
  EXPECT_EQ(getUsersPrimaryGroup(""), nullptr);

  EXPECT_EQ(groups.calls(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> getUsersPrimaryGroup", "D vra_get_usr_gid: name=nobody-here gid=-99\n",
                          "D getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n",
                          "< getUsersPrimaryGroup 0", "> getUsersPrimaryGroup",
                          "D vra_get_usr_gid: name= gid=-99\n",
                          "D getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n",
                          "< getUsersPrimaryGroup 0"));
}

TEST(PrimaryGroup, OfAProcessWithoutAnAccountIsNull) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kUnknown, [] {
      const Records records;
      EXPECT_EQ(getUsersPrimaryGroup(nullptr), nullptr);
      EXPECT_THAT(records.trail(),
                  ElementsAre("> getUsersPrimaryGroup", "D vra_get_usr_gid: name=NULL gid=-99\n",
                              "D getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n",
                              "< getUsersPrimaryGroup 0"));
    });
  });
}

TEST(PrimaryGroup, WithoutALineInTheDatabaseIsNull) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    EXPECT_EQ(getUsersPrimaryGroup("stray"), nullptr);
    EXPECT_THAT(records.trail(),
                ElementsAre("> getUsersPrimaryGroup", "D vra_get_usr_gid: name=stray gid=2999\n",
                            "D vra_getgrgid_name: gid=2999 ret_name=0\n",
                            "D getUsersPrimaryGroup: vra_getgrgid_name did not find group.\n",
                            "< getUsersPrimaryGroup 0"));
  });
}

TEST(PrimaryGroup, WhoseIdReadsAsTheNotFoundValueCountsAsAnUnknownUser) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    const Records records;
    EXPECT_EQ(getUsersPrimaryGroup("minus"), nullptr);
    EXPECT_THAT(records.texts(),
                ElementsAre("vra_get_usr_gid: name=minus gid=-99\n",
                            "getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n"));
  });
}

TEST(PrimaryGroup, IsNullWithoutTheAccountMutexOrMemory) {
  constexpr char kNoUser[] = "getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n";
  constexpr char kNoGroup[] = "getUsersPrimaryGroup: vra_getgrgid_name did not find group.\n";
  const auto failing = [](Call call, int nth, const char* message) {
    SCOPED_TRACE(message);
    const Records records;
    const LiveAllocations memory;
    const FailingCall fault(call, call == Call::strdup ? ENOMEM : EINVAL, nth);
    EXPECT_EQ(getUsersPrimaryGroup("root"), nullptr);
    EXPECT_TRUE(fault.fired());
    EXPECT_EQ(records.texts().back(), message);
    EXPECT_EQ(memory.blocks(), 0);
  };

  failing(Call::pthread_mutex_lock, 1, kNoUser);
  failing(Call::pthread_mutex_lock, 2, kNoGroup);
  if (!sanitizerOwnsMalloc()) failing(Call::strdup, 1, kNoGroup);
  EXPECT_NE(taken(getUsersPrimaryGroup("root")), "(none)") << "the mutex serves again";
}

TEST(PrimaryGroup, AndMembershipAreTracedUnderTheSecondMaskBitOnly) {
  const auto calls = [] {
    free(getUsersPrimaryGroup("nobody-here"));
    isMemberOfGroup(nullptr, nullptr);
  };
  {
    const Records records(kEntryExit43 | kExitError43);
    calls();
    EXPECT_THAT(records.trail(), ElementsAre("> getUsersPrimaryGroup", "< getUsersPrimaryGroup 0",
                                             "> isMemberOfGroup", "< isMemberOfGroup 0"));
  }
  const Records records(kEntryExit33 | kExitError33);
  calls();
  EXPECT_THAT(records.trail(), IsEmpty());
}

// ---- isMemberOfGroup ----

TEST(Membership, OfAListedUserNeedsNoAccount) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;
    const FailingCall users(Call::getpwnam, 0, kNever);

    EXPECT_TRUE(isMemberOfGroup("zed", "staff"));
    EXPECT_TRUE(isMemberOfGroup("bob", "staff"));

    EXPECT_EQ(users.calls(), 0) << "the primary group is asked for only when no member is the user";
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(
        trailOf(records),
        ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=staff ret_grpList=*\n",
                    "<! isMemberOfGroup 1", "> isMemberOfGroup",
                    "D ldap_getgrnam_mem: name=staff ret_grpList=*\n", "<! isMemberOfGroup 1"));
  });
}

TEST(Membership, ByPrimaryGroupNeedsNoLineAmongTheMembers) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;

    EXPECT_TRUE(isMemberOfGroup("far", "far"));

    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(
        trailOf(records),
        ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=far ret_grpList=*\n",
                    "> getUsersPrimaryGroup", "D vra_get_usr_gid: name=far gid=-1294967295\n",
                    "D vra_getgrgid_name: gid=-1294967295 ret_name=*\n", "< getUsersPrimaryGroup 0",
                    "<! isMemberOfGroup 1"));
  });
}

TEST(Membership, IgnoresTheCaseOfTheUsersName) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    EXPECT_TRUE(isMemberOfGroup("ZED", "staff"));
    EXPECT_TRUE(isMemberOfGroup("carl", "choir"));
    EXPECT_TRUE(isMemberOfGroup("cARL", "choir"));
    EXPECT_FALSE(isMemberOfGroup("ze", "staff"));
    EXPECT_FALSE(isMemberOfGroup("zedd", "staff"));
  });
}

TEST(Membership, IgnoresTheCaseOfThePrimaryGroupsName) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    EXPECT_TRUE(isMemberOfGroup("ann", "STAFF"))
        << "another group, but equal without regard to case";
    EXPECT_FALSE(isMemberOfGroup("zed", "STAFF")) << "a member of staff only";
    EXPECT_FALSE(isMemberOfGroup("ann", "Staff")) << "no group has that name";
  });
}

TEST(Membership, IsDeniedToAUserOfAnotherGroup) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;

    EXPECT_FALSE(isMemberOfGroup("far", "staff"));
    EXPECT_FALSE(isMemberOfGroup("ann", "music")) << "a group without members";

    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(
        trailOf(records),
        ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=staff ret_grpList=*\n",
                    "> getUsersPrimaryGroup", "D vra_get_usr_gid: name=far gid=-1294967295\n",
                    "D vra_getgrgid_name: gid=-1294967295 ret_name=*\n", "< getUsersPrimaryGroup 0",
                    "< isMemberOfGroup 0", "> isMemberOfGroup",
                    "D ldap_getgrnam_mem: name=music ret_grpList=*\n", "> getUsersPrimaryGroup",
                    "D vra_get_usr_gid: name=ann gid=2001\n",
                    "D vra_getgrgid_name: gid=2001 ret_name=*\n", "< getUsersPrimaryGroup 0",
                    "< isMemberOfGroup 0"));
  });
}

TEST(Membership, IsDeniedToAnUnlistedUserWithoutAnAccount) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    for (const std::string user : {"who", ""}) {
      const Records records;
      EXPECT_FALSE(isMemberOfGroup(user.c_str(), "staff"));
      EXPECT_THAT(
          trailOf(records),
          ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=staff ret_grpList=*\n",
                      "> getUsersPrimaryGroup", "D vra_get_usr_gid: name=" + user + " gid=-99\n",
                      "D getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n",
                      "< getUsersPrimaryGroup 0", "< isMemberOfGroup 0"));
    }
  });
}

TEST(Membership, IsDeniedToAUserWhosePrimaryGroupHasNoLine) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    EXPECT_FALSE(isMemberOfGroup("stray", "staff"));
    EXPECT_THAT(trailOf(records),
                ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=staff ret_grpList=*\n",
                            "> getUsersPrimaryGroup", "D vra_get_usr_gid: name=stray gid=2999\n",
                            "D vra_getgrgid_name: gid=2999 ret_name=0\n",
                            "D getUsersPrimaryGroup: vra_getgrgid_name did not find group.\n",
                            "< getUsersPrimaryGroup 0", "< isMemberOfGroup 0"));
  });
}

TEST(Membership, OfANullGroupIsRefusedBeforeAnyLookUp) {
  const Records records;
  const LookUps look_ups;

  EXPECT_FALSE(isMemberOfGroup("root", nullptr));
  EXPECT_FALSE(isMemberOfGroup(nullptr, nullptr));

  EXPECT_EQ(look_ups.calls(), 0);
  EXPECT_THAT(records.trail(),
              ElementsAre("> isMemberOfGroup", "D isMemberOfGroup: NULL pointer passed in.\n",
                          "< isMemberOfGroup 0", "> isMemberOfGroup",
                          "D isMemberOfGroup: NULL pointer passed in.\n", "< isMemberOfGroup 0"));
}

TEST(Membership, OfAnUnknownOrEmptyGroupIsDeniedWithoutALookAtTheUser) {
  const FailingCall users(Call::getpwnam, 0, kNever);
  for (const std::string group : {"nogroup-here", ""}) {
    const Records records;
    EXPECT_FALSE(isMemberOfGroup("root", group.c_str()));
    EXPECT_THAT(
        records.trail(),
        ElementsAre("> isMemberOfGroup", "D ldap_getgrnam_mem: name=" + group + " ret_grpList=0\n",
                    "D isMemberOfGroup: vra_getgrnam_mem did not find group.\n",
                    "< isMemberOfGroup 0"));
  }
  EXPECT_EQ(users.calls(), 0);
}

TEST(Membership, OfANullUserGoesByTheProcessesPrimaryGroup) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kAnn, [] {
      const Records records;
      const LiveAllocations memory;

      EXPECT_TRUE(isMemberOfGroup(nullptr, "staff"));

      EXPECT_EQ(memory.blocks(), 0);
      EXPECT_THAT(trailOf(records),
                  ElementsAre("> isMemberOfGroup", "D vra_get_usr_name: name=NULL ret_name=*\n",
                              "D ldap_getgrnam_mem: name=staff ret_grpList=*\n",
                              "> getUsersPrimaryGroup", "D vra_get_usr_gid: name=ann gid=2001\n",
                              "D vra_getgrgid_name: gid=2001 ret_name=*\n",
                              "< getUsersPrimaryGroup 0", "<! isMemberOfGroup 1"));
    });
  });
}

TEST(Membership, OfANullUserDoesNotGoByTheMembers) {
  REQUIRE_ACCOUNTS();
  withMoreAccounts([] {
    asUserExpecting(kAnn, [] {
      const LiveAllocations memory;
      EXPECT_TRUE(isMemberOfGroup("ann", "choir"));
      EXPECT_FALSE(isMemberOfGroup(nullptr, "choir")) << "only the argument is compared with them";
      EXPECT_EQ(memory.blocks(), 0);
    });
  });
}

TEST(Membership, OfANullUserWithoutAnAccountIsDeniedWithoutALookAtTheGroup) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kUnknown, [] {
      const Records records;
      const FailingCall groups(Call::getgrnam, 0, kNever);

      EXPECT_FALSE(isMemberOfGroup(nullptr, "staff"));

      EXPECT_EQ(groups.calls(), 0);
      EXPECT_THAT(records.trail(),
                  ElementsAre("> isMemberOfGroup", "D vra_get_usr_name: name=NULL ret_name=0\n",
                              "D isMemberOfGroup: vra_get_usr_name could not find user.\n",
                              "< isMemberOfGroup 0"));
    });
  });
}

TEST(Membership, OfANullUserInAnUnknownGroupLeavesNothingAllocated) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const Records records;
    const LiveAllocations memory;

    EXPECT_FALSE(isMemberOfGroup(nullptr, "nogroup-here"));

    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(trailOf(records),
                ElementsAre("> isMemberOfGroup", "D vra_get_usr_name: name=NULL ret_name=*\n",
                            "D ldap_getgrnam_mem: name=nogroup-here ret_grpList=0\n",
                            "D isMemberOfGroup: vra_getgrnam_mem did not find group.\n",
                            "< isMemberOfGroup 0"));
  });
}

TEST(Membership, OfTwentyThousandIsSearchedToItsEnd) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const LiveAllocations memory;
    EXPECT_TRUE(isMemberOfGroup("member0", "many"));
    EXPECT_TRUE(isMemberOfGroup("MEMBER19999", "many"));
    EXPECT_FALSE(isMemberOfGroup("member20000", "many"));
    EXPECT_EQ(memory.blocks(), 0);
  });
}

TEST(Membership, IsDeniedWhenALookUpCannotHaveTheMutex) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    constexpr const char* kMessages[] = {
        "isMemberOfGroup: vra_get_usr_name could not find user.\n",
        "isMemberOfGroup: vra_getgrnam_mem did not find group.\n",
        "getUsersPrimaryGroup: vra_get_usr_gid could not find user.\n",
        "getUsersPrimaryGroup: vra_getgrgid_name did not find group.\n",
    };
    int nth = 0;
    for (const char* const message : kMessages) {
      SCOPED_TRACE(message);
      const Records records;
      const LiveAllocations memory;
      const FailingCall lock(Call::pthread_mutex_lock, EINVAL, ++nth);
      EXPECT_FALSE(isMemberOfGroup(nullptr, "root"));
      EXPECT_TRUE(lock.fired());
      EXPECT_EQ(records.texts().back(), message);
      EXPECT_EQ(memory.blocks(), 0);
    }
    EXPECT_TRUE(isMemberOfGroup(nullptr, "root"));
  });
}

TEST(Membership, IsDeniedWhenMemoryRunsOutAnywhere) {
  REQUIRE_OWN_MALLOC();
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    asUserExpecting(kAnn, [] {
      int nth = 1;
      for (;; ++nth) {
        SCOPED_TRACE(nth);
        const LiveAllocations memory;
        FailingCall allocation(Call::allocation, ENOMEM, nth);
        const bool answer = isMemberOfGroup(nullptr, "staff");
        allocation.disarm();
        EXPECT_EQ(memory.blocks(), 0);
        EXPECT_EQ(answer, !allocation.fired());
        if (!allocation.fired()) break;
      }
      EXPECT_EQ(nth, 7) << "the own name, a list of three names and the group's name";
    });
  });
}

}  // namespace
