#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

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

constexpr int kNever = INT_MAX;  // a fault that only counts

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
  if (sanitizerOwnsMalloc()) GTEST_SKIP() << "the sanitizer owns malloc";
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
  if (sanitizerOwnsMalloc()) GTEST_SKIP() << "the sanitizer owns malloc";
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

using Trail = std::vector<std::string>;

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

}  // namespace
