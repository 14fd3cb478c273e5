#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <regex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "calls.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

namespace {

constexpr uid_t kAnn = 1001;
constexpr gid_t kStaff = 2001;
constexpr gid_t kMusic = 2002;
constexpr uid_t kStray = 1002;  // its primary group has no line
constexpr uid_t kUnknown = 1999;
constexpr uid_t kFar = 3000000000;
constexpr int kFarAsInt = -1294967296;
constexpr int kManyMembers = 20000;

constexpr char kPasswd[] =
    "root:x:0:0:root:/root:/bin/sh\n"
    "ann:x:1001:2001:Ann:/home/ann:/bin/sh\n"
    "stray:x:1002:2999:Stray:/home/stray:/bin/sh\n"
    "far:x:3000000000:3000000001:Far:/home/far:/bin/sh\n";

std::string groupFile() {
  std::string many = "many:x:2004:member0";
  for (int i = 1; i < kManyMembers; ++i) many += ",member" + std::to_string(i);
  return "root:x:0:\n"
         "staff:x:2001:zed,ann,bob\n"
         "music:x:2002:\n"
         "far:x:3000000001:\n" +
         many + "\n";
}

// Runs the body in a child process whose /etc has the accounts above and no others.
void withAccounts(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\n");
              writeFile("/etc/passwd", kPasswd);
              writeFile("/etc/group", groupFile());
              body();
              return 0;
            }),
            0);
}

void asUserExpecting(uid_t uid, const std::function<void()>& body) {
  EXPECT_EQ(asUser(uid,
                   [&] {
                     body();
                     return 0;
                   }),
            0);
}

// The string, freed.
std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

// The list, freed.
std::vector<std::string> taken(char** owned) {
  if (owned == nullptr) return {"(none)"};
  std::vector<std::string> texts;
  for (char** entry = owned; *entry != nullptr; ++entry) texts.push_back(taken(*entry));
  free(static_cast<void*>(owned));
  return texts;
}

// A pointer as "%d" prints it.
std::string asNumber(const void* pointer) {
  return std::to_string(static_cast<int>(reinterpret_cast<intptr_t>(pointer)));
}

#define REQUIRE_ACCOUNTS() REQUIRE_ROOT("for a private /etc with its own accounts")

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
  // Refused, it would not get as far as the mutex. With the mutex, the database would follow it.
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
    EXPECT_EQ(vra_get_usr_gid("stray"), 2999);  // no matter whether that group exists
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

// ---- setFileOwnersAndPermissions ----

struct Ownership {
  uid_t owner;
  gid_t group;
  unsigned int mode;
  bool operator==(const Ownership&) const = default;
};

void PrintTo(const Ownership& ownership, std::ostream* out) {
  *out << ownership.owner << ":" << ownership.group << " mode 0" << std::oct << ownership.mode
       << std::dec;
}

// Of the path itself, a link not followed.
Ownership ownershipOf(const std::string& path) {
  struct stat status = {};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return {status.st_uid, status.st_gid, status.st_mode & 07777U};
}

// The records of a call that looked up these accounts and ended like this.
Trail setTrail(const Trail& inside, bool result) {
  Trail trail = {"> setFileOwnersAndPermissions"};
  trail.insert(trail.end(), inside.begin(), inside.end());
  trail.push_back(result ? "<! setFileOwnersAndPermissions 1" : "< setFileOwnersAndPermissions 0");
  return trail;
}

constexpr char kAnnsUid[] = "D vra_get_uid: name=ann uid=1001\n";
constexpr char kAnnsGid[] = "D vra_get_usr_gid: name=ann gid=2001\n";
constexpr char kAnnsGroup[] = "D vra_getgrgid_gid: gid=2001 ret_gid=2001\n";

// A temporary directory with one root-owned file of mode 0644, and an open descriptor of it.
struct OneFile {
  OneFile() : path(temp.file("file", "text")), descriptor(open(path.c_str(), O_RDWR | O_CLOEXEC)) {}
  ~OneFile() { close(descriptor); }
  OneFile(const OneFile&) = delete;
  OneFile& operator=(const OneFile&) = delete;

  const TempDir temp;
  std::string path;
  int descriptor;
};

constexpr Ownership kUntouched{0, 0, 0644};

TEST(SetFileOwners, RefusesANullPathEvenWithADescriptor) {
  const OneFile file;
  const Ownership before = ownershipOf(file.path);
  for (const int descriptor : {file.descriptor, +FILE_DESC_USE_PATH, +FILE_DESC_USE_LINK_PATH}) {
    const Records records;
    EXPECT_FALSE(setFileOwnersAndPermissions(descriptor, nullptr, nullptr, nullptr, 0600));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(
                    setTrail({"E setFileOwnersAndPermissions: passed a null pointer.\n"}, false)));
  }
  EXPECT_EQ(ownershipOf(file.path), before);
}

TEST(SetFileOwners, ThroughADescriptor) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    std::string elsewhere = file.temp.path("no such file");  // not what is changed
    const Records records;

    EXPECT_TRUE(
        setFileOwnersAndPermissions(file.descriptor, elsewhere.data(), ann, nullptr, 04751));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, kStaff, 04751}));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup}, true)));
    EXPECT_EQ(records.exitCode(), 1);
  });
}

TEST(SetFileOwners, ThroughAPathToANamedGroup) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    char music[] = "music";
    const Records records;

    EXPECT_TRUE(
        setFileOwnersAndPermissions(FILE_DESC_USE_PATH, file.path.data(), ann, music, 02640));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, kMusic, 02640}));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail(
                    {kAnnsUid, kAnnsGid, "D vra_getgrnam_gid: name=music gid=2002\n"}, true)));
  });
}

TEST(SetFileOwners, ThroughAPathFollowsALink) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const OneFile file;
    char ann[] = "ann";
    std::string link = file.temp.path("link");
    ASSERT_EQ(symlink(file.path.c_str(), link.c_str()), 0);
    const Ownership of_link = ownershipOf(link);

    EXPECT_TRUE(setFileOwnersAndPermissions(FILE_DESC_USE_PATH, link.data(), ann, nullptr, 0604));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, kStaff, 0604}));
    EXPECT_EQ(ownershipOf(link), of_link);
  });
}

TEST(SetFileOwners, OfALinkLeavesItsTargetAlone) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const OneFile file;
    char ann[] = "ann";
    std::string link = file.temp.path("link");
    ASSERT_EQ(symlink(file.path.c_str(), link.c_str()), 0);
    const FailingCall modes(Call::chmod, 0, kNever);
    const FailingCall descriptor_modes(Call::fchmod, 0, kNever);
    const Records records;

    EXPECT_TRUE(
        setFileOwnersAndPermissions(FILE_DESC_USE_LINK_PATH, link.data(), ann, nullptr, 0600));

    EXPECT_EQ(ownershipOf(link), (Ownership{kAnn, kStaff, 0777}));
    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_EQ(modes.calls() + descriptor_modes.calls(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup}, true)));
  });
}

TEST(SetFileOwners, AreThoseOfTheProcessWithoutAUserAndAGroup) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    ASSERT_EQ(chown(file.path.c_str(), kStray, kMusic), 0);
    const Records records;

    EXPECT_TRUE(
        setFileOwnersAndPermissions(FILE_DESC_USE_PATH, file.path.data(), nullptr, nullptr, 0600));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{0, 0, 0600}));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail(
                    {"D vra_get_uid: name=NULL uid=0\n", "D vra_get_usr_gid: name=NULL gid=0\n",
                     "D vra_getgrgid_gid: gid=0 ret_gid=0\n"},
                    true)));
  });
}

TEST(SetFileOwners, WithAnUnknownUserChangesNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char who[] = "who";
    const Records records;

    EXPECT_FALSE(
        setFileOwnersAndPermissions(file.descriptor, file.path.data(), who, nullptr, 0600));

    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_THAT(records.trail(), ElementsAreArray(setTrail(
                                     {"D vra_get_uid: name=who uid=-99\n",
                                      "D setFileOwnersAndPermissions: user who does not exist.\n"},
                                     false)));
  });
}

TEST(SetFileOwners, WithAProcessThatHasNoAccountChangesNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    ASSERT_EQ(chown(file.path.c_str(), kUnknown, kStaff), 0);
    asUserExpecting(kUnknown, [&] {
      const Records records;

      EXPECT_FALSE(setFileOwnersAndPermissions(FILE_DESC_USE_PATH, file.path.data(), nullptr,
                                               nullptr, 0600));

      EXPECT_THAT(records.trail(),
                  ElementsAreArray(
                      setTrail({"D vra_get_uid: name=NULL uid=-99\n",
                                "D setFileOwnersAndPermissions: user (null) does not exist.\n"},
                               false)));
    });
    EXPECT_EQ(ownershipOf(file.path), (Ownership{kUnknown, kStaff, 0644}));
  });
}

TEST(SetFileOwners, WithAUserThatVanishesBetweenTheLookUpsChangesNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    const Records records;
    const FailingCall second(Call::getpwnam, ENOENT, 2);

    EXPECT_FALSE(
        setFileOwnersAndPermissions(file.descriptor, file.path.data(), ann, nullptr, 0600));

    ASSERT_TRUE(second.fired());
    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(
                    setTrail({kAnnsUid, "D vra_get_usr_gid: name=ann gid=-99\n",
                              "D setFileOwnersAndPermissions: user's ann group does not exist.\n"},
                             false)));
  });
}

TEST(SetFileOwners, WithAnUnknownOrEmptyGroupChangesNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    for (std::string group : {"nogroup-here", ""}) {
      SCOPED_TRACE(group);
      const Records records;

      EXPECT_FALSE(
          setFileOwnersAndPermissions(file.descriptor, file.path.data(), ann, group.data(), 0600));

      EXPECT_EQ(ownershipOf(file.path), kUntouched);
      EXPECT_THAT(records.trail(),
                  ElementsAreArray(setTrail(
                      {kAnnsUid, kAnnsGid, "D vra_getgrnam_gid: name=" + group + " gid=-99\n",
                       "E setFileOwnersAndPermissions: group " + group + " does not exist.\n"},
                      false)));
    }
  });
}

TEST(SetFileOwners, WithAPrimaryGroupThatDoesNotExistChangesNothing) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char stray[] = "stray";
    const Records records;

    EXPECT_FALSE(
        setFileOwnersAndPermissions(file.descriptor, file.path.data(), stray, nullptr, 0600));

    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_THAT(
        records.trail(),
        ElementsAreArray(setTrail(
            {"D vra_get_uid: name=stray uid=1002\n", "D vra_get_usr_gid: name=stray gid=2999\n",
             "D vra_getgrgid_gid: gid=2999 ret_gid=-99\n",
             "E setFileOwnersAndPermissions: group (null) does not exist.\n"},
            false)));
  });
}

TEST(SetFileOwners, TakeANamedGroupForAUserWhosePrimaryGroupDoesNotExist) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char stray[] = "stray";
    char music[] = "music";

    EXPECT_TRUE(setFileOwnersAndPermissions(file.descriptor, file.path.data(), stray, music, 0600));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{kStray, kMusic, 0600}));
  });
}

TEST(SetFileOwners, TakeIdsBeyondInt) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char far[] = "far";

    EXPECT_TRUE(setFileOwnersAndPermissions(file.descriptor, file.path.data(), far, nullptr, 0600));

    EXPECT_EQ(ownershipOf(file.path), (Ownership{kFar, kFar + 1, 0600}));
  });
}

constexpr char kChownFailed[] = "E setFileOwnersAndPermissions: chown failed with errno=5.\n";
constexpr char kChmodFailed[] = "E setFileOwnersAndPermissions: chmod failed with errno=5.\n";

TEST(SetFileOwners, ThroughADescriptorStopsAtAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    const Records records;
    const FailingCall failing(Call::fchown, EIO);

    EXPECT_FALSE(
        setFileOwnersAndPermissions(file.descriptor, file.path.data(), ann, nullptr, 0600));

    ASSERT_TRUE(failing.fired());
    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup, kChownFailed}, false)));
  });
}

TEST(SetFileOwners, OfALinkStopsAtAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    const Records records;
    const FailingCall failing(Call::lchown, EIO);

    EXPECT_FALSE(
        setFileOwnersAndPermissions(FILE_DESC_USE_LINK_PATH, file.path.data(), ann, nullptr, 0600));

    ASSERT_TRUE(failing.fired());
    EXPECT_EQ(ownershipOf(file.path), kUntouched);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup, kChownFailed}, false)));
  });
}

TEST(SetFileOwners, ThroughAPathGoOnToTheModeAfterAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    const Records records;
    const FailingCall failing(Call::chown, EIO);

    EXPECT_TRUE(
        setFileOwnersAndPermissions(FILE_DESC_USE_PATH, file.path.data(), ann, nullptr, 0600));

    ASSERT_TRUE(failing.fired());
    EXPECT_EQ(ownershipOf(file.path), (Ownership{0, 0, 0600}));
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup, kChownFailed}, true)));
  });
}

TEST(SetFileOwners, OfAnOrdinaryUsersOwnFileFailButItsModeIsSet) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    ASSERT_EQ(chown(file.path.c_str(), kAnn, kStaff), 0);
    asUserExpecting(kAnn, [&] {
      char root[] = "root";
      const Records records;

      EXPECT_TRUE(
          setFileOwnersAndPermissions(FILE_DESC_USE_PATH, file.path.data(), root, nullptr, 0604));

      EXPECT_THAT(records.trail(),
                  ElementsAreArray(setTrail(
                      {"D vra_get_uid: name=root uid=0\n", "D vra_get_usr_gid: name=root gid=0\n",
                       "D vra_getgrgid_gid: gid=0 ret_gid=0\n",
                       "E setFileOwnersAndPermissions: chown failed with errno=1.\n"},
                      true)));
    });
    EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, kStaff, 0604}));
  });
}

TEST(SetFileOwners, StayChangedWhenTheModeCannotBeSet) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    const struct {
      int descriptor;
      Call mode_call;
    } forms[] = {{0, Call::fchmod}, {FILE_DESC_USE_PATH, Call::chmod}};
    for (const auto& form : forms) {
      SCOPED_TRACE(form.descriptor);
      OneFile file;
      char ann[] = "ann";
      const Records records;
      const FailingCall failing(form.mode_call, EIO);

      EXPECT_FALSE(
          setFileOwnersAndPermissions(form.descriptor == 0 ? file.descriptor : form.descriptor,
                                      file.path.data(), ann, nullptr, 0600));

      ASSERT_TRUE(failing.fired());
      EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, kStaff, 0644}));
      EXPECT_THAT(records.trail(), ElementsAreArray(setTrail(
                                       {kAnnsUid, kAnnsGid, kAnnsGroup, kChmodFailed}, false)));
    }
  });
}

TEST(SetFileOwners, ThroughAPathReportBothFailuresInTheirOrder) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    std::string missing = file.temp.path("missing");
    char ann[] = "ann";
    const Records records;

    EXPECT_FALSE(
        setFileOwnersAndPermissions(FILE_DESC_USE_PATH, missing.data(), ann, nullptr, 0600));

    EXPECT_THAT(
        records.trail(),
        ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup,
                                   "E setFileOwnersAndPermissions: chown failed with errno=2.\n",
                                   "E setFileOwnersAndPermissions: chmod failed with errno=2.\n"},
                                  false)));
    EXPECT_FALSE(pathExists(missing));
  });
}

TEST(SetFileOwners, TakeAnyOtherNegativeNumberForADescriptor) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    for (const int descriptor : {-1, -9998, -8887}) {
      const Records records;
      EXPECT_FALSE(setFileOwnersAndPermissions(descriptor, file.path.data(), ann, nullptr, 0600));
      EXPECT_THAT(
          records.trail(),
          ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup,
                                     "E setFileOwnersAndPermissions: chown failed with errno=9.\n"},
                                    false)));
    }
    EXPECT_EQ(ownershipOf(file.path), kUntouched);
  });
}

TEST(SetFileOwners, SelectorsHaveTheirPublishedValues) {
  EXPECT_EQ(FILE_DESC_USE_PATH, -9999);
  EXPECT_EQ(FILE_DESC_USE_LINK_PATH, -8888);
}

TEST(SetFileOwners, WithoutTheAccountMutexGoByTheAnswersOfTheLookUps) {
  REQUIRE_ACCOUNTS();
  withAccounts([] {
    OneFile file;
    char ann[] = "ann";
    char music[] = "music";
    {
      const FailingCall first(Call::pthread_mutex_lock, EINVAL, 1);
      EXPECT_FALSE(
          setFileOwnersAndPermissions(file.descriptor, file.path.data(), ann, music, 0600));
      ASSERT_TRUE(first.fired());
      EXPECT_EQ(ownershipOf(file.path), kUntouched);
    }
    const FailingCall third(Call::pthread_mutex_lock, EINVAL, 3);
    EXPECT_TRUE(setFileOwnersAndPermissions(file.descriptor, file.path.data(), ann, music, 0600));
    ASSERT_TRUE(third.fired());
    EXPECT_EQ(ownershipOf(file.path), (Ownership{kAnn, 0, 0600})) << "the group look-up answered 0";
  });
}

// ---- Users and groups ----

constexpr char kMorePasswd[] =
    "bare:x:1010:2001:Bare:/home:/bin/sh\n"
    "upper:x:1011:2001:Upper:/HOME:/bin/sh\n"
    "slash:x:1012:2001:Slash:/home/:/bin/sh\n"
    "longer:x:1013:2001:Longer:/homes:/bin/sh\n"
    "below:x:1014:2001:Below:/home/bare/home:/bin/sh\n"
    "empty:x:1015:2001:Empty::/bin/sh\n"
    "minus:x:4294967197:4294967197:Minus:/home/minus:/bin/sh\n";

// "STAFF" is another group than "staff", and the primary group of nobody.
constexpr char kMoreGroups[] =
    "STAFF:x:2005:\n"
    "choir:x:2006:Carl,ann,zed\n"
    "minus:x:4294967197:\n";

void withMoreAccounts(const std::function<void()>& body) {
  withAccounts([&] {
    writeFile("/etc/passwd", std::string(kPasswd) + kMorePasswd);
    writeFile("/etc/group", groupFile() + kMoreGroups);
    body();
  });
}

// The trail, with "*" for the pointers that the look-ups name in their messages.
Trail trailOf(const Records& records) {
  static const std::regex pointer("(dir|ret_name|ret_grpList)=-?[1-9][0-9]*");
  Trail trail = records.trail();
  for (std::string& line : trail) line = std::regex_replace(line, pointer, "$1=*");
  return trail;
}

// The library's look-ups in the account database since construction.
class LookUps {
 public:
  int calls() const {
    return users_.calls() + own_user_.calls() + groups_.calls() + primary_groups_.calls();
  }

 private:
  const FailingCall users_{Call::getpwnam, 0, kNever};
  const FailingCall own_user_{Call::getpwuid, 0, kNever};
  const FailingCall groups_{Call::getgrnam, 0, kNever};
  const FailingCall primary_groups_{Call::getgrgid, 0, kNever};
};

// Which of the library's locks is that of its n-th look-up while messages are traced: every look-up
// writes one, and writing it takes a lock of its own.
constexpr int lockOfLookUp(int nth) { return 2 * nth - 1; }

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

  failing(Call::pthread_mutex_lock, lockOfLookUp(1), kNoUser);
  failing(Call::pthread_mutex_lock, lockOfLookUp(2), kNoGroup);
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
      const FailingCall lock(Call::pthread_mutex_lock, EINVAL, lockOfLookUp(++nth));
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

// ---- isValidUser ----

constexpr char kSuAnn[] = "/bin/su ann -c \"exit 0\" >>/dev/null 2>>/dev/null ";

// The records up to the test of the account, as root.
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

TEST(ValidUser, IsNoneForRootWhenTheCommandFailsAndTheMessageHasTheRawStatus) {
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

TEST(ValidUser, IsNoneWhenNoShellCanBeStarted) {
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

// ... with /bin/su itself. Nothing that it logs leaves this process's mounts.
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

TEST(ValidUser, IsNoneWhoseShellFailsOrWhomSuRefuses) {
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

TEST(HomeDirectory, OfTheBareBaseDirectoryGetsTheUsersNameInWhateverCase) {
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
      endpwent();  // closes what an earlier call left open
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

// The C library guards the database that getUserHomeDir rewinds and closes with a lock that the
// thread sanitizer does not see: it would report a race.
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

// ---- isValidName ----

constexpr char kEmptyName[] = "isValidName: Passed a NULL or empty name.\n";
constexpr char kLength[] = "isValidName: Error: Length violation.\n";
constexpr char kRange[] = "isValidName: Error: Character range violation.\n";
constexpr char kLetter[] = "isValidName: Error: Not starting with a letter.\n";
constexpr char kPrefix[] = "isValidName: Error: Cannot start with ORX, SYS or SQL.\n";
constexpr char kReserved[] =
    "isValidName: Error: Cannot be anyone of Users, Admins, guests, public and local.\n";

// Refused with the message, or accepted when there is none.
void expectName(const char* name, const char* message) {
  SCOPED_TRACE(name != nullptr ? testing::PrintToString(name) : "null");
  std::string copy = name != nullptr ? name : "";
  const Records records;

  EXPECT_EQ(isValidName(name != nullptr ? copy.data() : nullptr), message == nullptr);

  if (message == nullptr) {
    EXPECT_THAT(records.trail(), ElementsAre("> isValidName", "<! isValidName 1"));
  } else {
    EXPECT_THAT(records.trail(),
                ElementsAre("> isValidName", std::string("D ") + message, "< isValidName 0"));
  }
  EXPECT_EQ(copy, name != nullptr ? name : "");
}

TEST(ValidName, HasOneToEightCharacters) {
  expectName(nullptr, kEmptyName);
  expectName("", kEmptyName);
  expectName("a", nullptr);
  expectName("Z", nullptr);
  expectName("a1234567", nullptr);
  expectName("a12345678", kLength);
  expectName("public_or_private", kLength);
}

TEST(ValidName, TooLongIsThatWhateverElseIsWrongWithIt) {
  expectName("1-$%&/()=", kLength);
  expectName("sysadmins", kLength);
  expectName("\xc3\xa4\xc3\xb6\xc3\xbc\xc3\x9f\xc3", kLength);
}

TEST(ValidName, BeginsWithALetter) {
  expectName("1abc", kLetter);
  expectName("_abc", kLetter);
  expectName("0", kLetter);
  expectName("_", kLetter);
  expectName("$abc", kRange);   // the range is looked at first
  expectName("1ab-", kLetter);  // but not that of the later characters
}

TEST(ValidName, OfEveryTwoBytesHasALetterADigitOrAnUnderscoreBehindALetter) {
  for (int byte = 1; byte < 256; ++byte) {
    const bool is_letter = (byte >= 'A' && byte <= 'Z') || (byte >= 'a' && byte <= 'z');
    const bool in_range = is_letter || (byte >= '0' && byte <= '9') || byte == '_';
    const char behind[] = {'x', static_cast<char>(byte), '\0'};
    const char alone[] = {static_cast<char>(byte), '\0'};
    expectName(behind, in_range ? nullptr : kRange);
    expectName(alone, is_letter ? nullptr : in_range ? kLetter : kRange);
  }
}

TEST(ValidName, IsLookedAtToItsLastCharacter) {
  expectName("a-b", kRange);
  expectName("abcdefg-", kRange);
  expectName("abcdefg\xe9", kRange);
  expectName("sys-", kRange);  // before the reserved words
}

TEST(ValidName, DoesNotBeginWithAReservedPrefixInWhateverCase) {
  for (const char* const name :
       {"orx", "ORX", "Orxdb", "sql", "sqlx", "sQL1", "sys", "SYStem", "system_1"}) {
    expectName(name, kPrefix);
  }
  for (const char* const name : {"or", "sq", "sy", "orz", "sqx", "syx", "aorx", "asql", "asys",
                                 "s_ys", "osys", "ors", "sqs"}) {
    expectName(name, nullptr);
  }
}

TEST(ValidName, IsNoReservedWordInWhateverCase) {
  for (const char* const name : {"Users", "users", "USERS", "Admins", "admins", "ADMINS", "guests",
                                 "Guests", "public", "PUBLIC", "local", "LoCaL"}) {
    expectName(name, kReserved);
  }
  for (const char* const name :
       {"user", "Userss", "User", "admin", "Adminss", "guest", "guestss", "publi", "publics",
        "loca", "locals", "locale", "auser", "alocal", "apublic"}) {
    expectName(name, nullptr);
  }
}

}  // namespace
