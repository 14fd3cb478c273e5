#include <errno.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <string>
#include <utility>

#include "faults.h"
#include "osutils.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

TRACED_AND_NOT(GetFileOwners);

// The outputs of one call, with their values before it.
struct Owners {
  char* owner = untouched;
  char* group = untouched;
  unsigned int mode = 4711;

  bool get(const std::string& path) {
    return getFileOwnersAndPermissions(path.c_str(), &owner, &group, &mode);
  }
  void expectUntouched() const {
    EXPECT_EQ(owner, untouched);
    EXPECT_EQ(group, untouched);
    EXPECT_EQ(mode, 4711U);
  }
  ~Owners() {
    if (owner != untouched) free(owner);
    if (group != untouched) free(group);
  }
};

Trail ownersMessage(const std::string& text) {
  return debugLine("getFileOwnersAndPermissions: " + text);
}
// The messages of a look-up that succeeds with a buffer of `size` bytes.
Trail lookUp(const std::string& function, int size) {
  Trail all;
  for (int tried = 2048; tried < size; tried *= 2) {
    all = joined(all, ownersMessage(function + " invocation returned ERANGE with allocation at " +
                                    std::to_string(tried)));
  }
  return joined(all, ownersMessage(function + " invocation SUCCESSFUL with allocation at " +
                                   std::to_string(size)));
}
// The messages of a look-up for which no buffer is large enough.
Trail lookUpInVain(const std::string& function) {
  Trail all;
  for (int tried = 2048; tried <= 134217728; tried *= 2) {
    all = joined(all, ownersMessage(function + " invocation returned ERANGE with allocation at " +
                                    std::to_string(tried)));
  }
  return joined(all, ownersMessage(function + " terminating with next allocation at 268435456"));
}
template <typename... Inner>
Trail ownersCall(long code, const Inner&... inner) {
  return call("getFileOwnersAndPermissions", code, inner...);
}

TEST_P(GetFileOwners, RefusesANullPathOrName) {
  const std::string path = temp_.file("file", "text");
  const Trail refused = traced(ownersCall(0, ownersMessage("passed a null pointer.")));
  Owners owners;

  EXPECT_FALSE(getFileOwnersAndPermissions(nullptr, &owners.owner, &owners.group, &owners.mode));
  EXPECT_EQ(trail(), refused);
  EXPECT_FALSE(getFileOwnersAndPermissions(path.c_str(), nullptr, &owners.group, &owners.mode));
  EXPECT_EQ(trail(), refused);
  EXPECT_FALSE(getFileOwnersAndPermissions(path.c_str(), &owners.owner, nullptr, &owners.mode));
  EXPECT_EQ(trail(), refused);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, DiesOfANullMode) {
  const std::string path = temp_.file("file", "text");
  Owners owners;
  unsigned int* volatile none = nullptr;
  EXPECT_DEATH((void)getFileOwnersAndPermissions(path.c_str(), &owners.owner, &owners.group, none),
               "");
}

TEST_P(GetFileOwners, GivesTheNamesAndTheWholeModeWord) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  (void)trail();
  const LiveAllocations live;
  Owners owners;

  ASSERT_TRUE(owners.get(path));

  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 2);  // the two names; the buffers are freed
  }
  EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048))));
  EXPECT_STREQ(owners.owner, getpwuid(getuid())->pw_name);
  EXPECT_STREQ(owners.group, getgrgid(ownGroup())->gr_name);
  EXPECT_EQ(owners.mode, 0100644U);
}

TEST_P(GetFileOwners, TellsTheOwnerFromTheGroup) {
  REQUIRE_ROOT("to give a file away");
  const std::string path = temp_.file("file", "text");
  ASSERT_EQ(chown(path.c_str(), kNobody, 1), 0);
  ASSERT_EQ(chmod(path.c_str(), 06755), 0);
  Owners owners;
  ASSERT_TRUE(owners.get(path));
  EXPECT_STREQ(owners.owner, getpwuid(kNobody)->pw_name);
  EXPECT_STREQ(owners.group, getgrgid(1)->gr_name);
  EXPECT_EQ(owners.mode, 0106755U);
}

TEST_P(GetFileOwners, KeepsTheTypeBitsOfWhatIsNotAFile) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0600));  // for a group that exists
  const std::string directory = temp_.dir("directory");
  makeFifo(temp_.path("fifo"));
  makeLink(path, temp_.path("link"));
  for (const std::string& each : {directory, temp_.path("fifo")}) {
    ASSERT_EQ(chown(each.c_str(), getuid(), ownGroup()), 0);
    ASSERT_EQ(chmod(each.c_str(), 0710), 0);
  }
  const std::pair<std::string, unsigned int> cases[] = {
      {directory, S_IFDIR | 0710},
      {temp_.path("fifo"), S_IFIFO | 0710},
      {temp_.path("link"), S_IFREG | 0600},  // of the target
  };
  for (const auto& [each, mode] : cases) {
    SCOPED_TRACE(each);
    Owners owners;
    ASSERT_TRUE(owners.get(each));
    EXPECT_EQ(owners.mode, mode);
  }
}

TEST_P(GetFileOwners, SaysWhyThePathCannotBeExamined) {
  makeLink(temp_.path("nothing"), temp_.path("dangling"));
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {temp_.path("dangling"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    EXPECT_EQ(trail(),
              traced(ownersCall(0, ownersMessage("stat() - errno=" + std::to_string(reason)))));
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, WithoutMemoryForABufferFreesTheOther) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const char* const buffers[] = {"password", "group"};
  for (const int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    const LiveAllocations live;
    const FailingCall allocation(Call::malloc, ENOMEM, nth);
    Owners owners;

    EXPECT_FALSE(owners.get(path));

    ASSERT_TRUE(allocation.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, ownersMessage("the malloc for the sysconf " +
                                                          std::string(buffers[nth - 1]) +
                                                          " buffer size maximum failed - "
                                                          "value=2048"))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, ReportsALookUpThatFails) {
  const std::string path = temp_.file("file", "text");
  for (const int reason : {EIO, ENOENT, EINTR, EMFILE}) {
    SCOPED_TRACE(reason);
    const LiveAllocations live;
    const std::string text = " invocation returned non-zero return code=" + std::to_string(reason);
    {
      const FailingCall user(Call::getpwuid_r, reason);
      const FailingCall group(Call::getgrgid_r, EIO, 1000);  // counts only
      Owners owners;
      EXPECT_FALSE(owners.get(path));
      ASSERT_TRUE(user.fired());
      EXPECT_EQ(trail(), traced(ownersCall(0, ownersMessage("getpwuid_r" + text))));
      EXPECT_EQ(group.calls(), 0);
      owners.expectUntouched();
    }
    const FailingCall group(Call::getgrgid_r, reason);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(group.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, lookUp("getpwuid_r", 2048),
                                         ownersMessage("getgrgid_r" + text))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
}

TEST_P(GetFileOwners, GivesUpWhen128MiBAreNotEnough) {
  const std::string path = temp_.file("file", "text");
  const LiveAllocations live;
  {
    const FailingCall user(Call::getpwuid_r, ERANGE, 1, 100);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    EXPECT_EQ(user.calls(), 17);
    EXPECT_EQ(trail(), traced(ownersCall(0, lookUpInVain("getpwuid_r"))));
    EXPECT_EQ(live.blocks(), 0);
    owners.expectUntouched();
  }
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 100);
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  EXPECT_EQ(group.calls(), 17);
  EXPECT_EQ(trail(), traced(ownersCall(0, lookUp("getpwuid_r", 2048), lookUpInVain("getgrgid_r"))));
  EXPECT_EQ(live.blocks(), 0);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, SucceedsWith128MiB) {
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  (void)trail();
  const LiveAllocations live;
  const FailingCall user(Call::getpwuid_r, ERANGE, 1, 16);
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 16);
  Owners owners;

  EXPECT_TRUE(owners.get(path));

  EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 134217728),
                                       lookUp("getgrgid_r", 134217728))));
  EXPECT_STREQ(owners.owner, getpwuid(getuid())->pw_name);
  if (!sanitizerOwnsMalloc()) {
    EXPECT_EQ(live.blocks(), 2);
  }
}

TEST_P(GetFileOwners, LosesTheOldBufferWhenItCannotGrow) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const Trail too_small =
      ownersMessage("getpwuid_r invocation returned ERANGE with allocation at 2048");
  {
    const LiveAllocations live;
    const FailingCall user(Call::getpwuid_r, ERANGE);
    const FailingCall growth(Call::realloc, ENOMEM);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(growth.fired());
    EXPECT_EQ(trail(),
              traced(ownersCall(0, too_small,
                                ownersMessage("the realloc for the passwordbuffer size amount - "
                                              "value=4096"))));
    EXPECT_EQ(live.blocks(), 1);
    owners.expectUntouched();
  }
  const LiveAllocations live;
  const FailingCall group(Call::getgrgid_r, ERANGE, 1, 2);
  const FailingCall growth(Call::realloc, ENOMEM, 2);
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  ASSERT_TRUE(growth.fired());
  EXPECT_EQ(trail(),
            traced(ownersCall(
                0, lookUp("getpwuid_r", 2048),
                ownersMessage("getgrgid_r invocation returned ERANGE with allocation at 2048"),
                ownersMessage("getgrgid_r invocation returned ERANGE with allocation at 4096"),
                ownersMessage("the realloc for the group buffer size amount - value=8192"))));
  EXPECT_EQ(live.blocks(), 1);
  owners.expectUntouched();
}

TEST_P(GetFileOwners, FailsWhenNoAccountIsFoundTheGroupFirst) {
  const std::string path = temp_.file("file", "text");
  const Trail looked_up = joined(lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048));
  const LiveAllocations live;
  // With error 0, the look-up returns success and finds nothing.
  const FailingCall user(Call::getpwuid_r, 0, 1, 2);
  {
    const FailingCall group(Call::getgrgid_r, 0);
    Owners owners;
    EXPECT_FALSE(owners.get(path));
    ASSERT_TRUE(group.fired());
    EXPECT_EQ(trail(), traced(ownersCall(0, looked_up,
                                         ownersMessage("the value of gidInfo.gr_name returned "
                                                       "by getgrgid_r is NULL"))));
    owners.expectUntouched();
  }
  if (getgrgid(statusOf(path).st_gid) == nullptr) GTEST_SKIP() << "the own group has no account";
  Owners owners;
  EXPECT_FALSE(owners.get(path));
  ASSERT_TRUE(user.fired());
  EXPECT_EQ(trail(), traced(ownersCall(0, looked_up,
                                       ownersMessage("the value of uidInfo.pw_name returned "
                                                     "by getgrgid_r is NULL"))));
  EXPECT_EQ(live.blocks(), 0);
  owners.expectUntouched();
}

constexpr uid_t kUnused = 3'999'999'999U;  // no account has this id

// Runs the body with a private /etc whose account files end with these lines.
int withAccounts(const std::string& users, const std::string& groups,
                 const std::function<int()>& body) {
  return withPrivateEtc([&] {
    std::ofstream("/etc/passwd", std::ios::app) << users;
    std::ofstream("/etc/group", std::ios::app) << groups;
    writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\n");
    return body();
  });
}

std::string manyMembers(const std::string& group, int members) {
  std::string line = group + ":member0";
  for (int member = 1; member < members; ++member) line += ",member" + std::to_string(member);
  return line + "\n";
}

TEST_P(GetFileOwners, FailsForIdsWithoutAnAccountAmongManyOthers) {
  REQUIRE_ROOT("for accounts of its own");
  const std::string path = temp_.file("file", "text");
  const Trail looked_up = joined(lookUp("getpwuid_r", 2048), lookUp("getgrgid_r", 2048));
  const Trail no_user =
      ownersMessage("the value of uidInfo.pw_name returned by getgrgid_r is NULL");
  const Trail no_group =
      ownersMessage("the value of gidInfo.gr_name returned by getgrgid_r is NULL");
  EXPECT_EQ(withAccounts("last:x:60001:60001::/:/bin/sh\n", "last:x:60001:\n",
                         [&] {
                           const struct {
                             uid_t owner;
                             gid_t group;
                             const Trail& message;
                           } cases[] = {{kUnused, 0, no_user},
                                        {0, kUnused, no_group},
                                        {kUnused, kUnused, no_group}};
                           for (const auto& each : cases) {
                             SCOPED_TRACE(each.owner);
                             EXPECT_EQ(chown(path.c_str(), each.owner, each.group), 0);
                             Owners owners;
                             EXPECT_FALSE(owners.get(path));
                             EXPECT_EQ(trail(), traced(ownersCall(0, looked_up, each.message)));
                             owners.expectUntouched();
                           }
                           return 0;
                         }),
            0);
}

TEST_P(GetFileOwners, GrowsItsBuffersForLargeAccounts) {
  REQUIRE_ROOT("for accounts of its own");
  const std::string path = temp_.file("file", "text");
  ASSERT_EQ(chown(path.c_str(), 60001, 60002), 0);
  EXPECT_EQ(withAccounts("wordy:x:60001:60002:" + std::string(3000, 'c') + ":/:/bin/sh\n",
                         manyMembers("crowd:x:60002", 5000),
                         [&] {
                           // Determines the size that the group needs with the C library alone.
                           int size = 2048;
                           struct group record = {};
                           struct group* found = nullptr;
                           std::string buffer;
                           do {
                             size *= 2;
                             buffer.resize(static_cast<size_t>(size));
                           } while (getgrgid_r(60002, &record, buffer.data(), buffer.size(),
                                               &found) == ERANGE);
                           EXPECT_GT(size, 32768);

                           const LiveAllocations live;
                           Owners owners;
                           EXPECT_TRUE(owners.get(path));
                           if (!sanitizerOwnsMalloc()) {
                             EXPECT_EQ(live.blocks(), 2);
                           }
                           EXPECT_EQ(trail(), traced(ownersCall(1, lookUp("getpwuid_r", 4096),
                                                                lookUp("getgrgid_r", size))));
                           EXPECT_STREQ(owners.owner, "wordy");
                           EXPECT_STREQ(owners.group, "crowd");
                           return 0;
                         }),
            0);
}

TEST_P(GetFileOwners, DoesNotNoticeANameThatCannotBeCopied) {
  REQUIRE_OWN_MALLOC();
  std::string path = temp_.path("file");
  ASSERT_TRUE(createFile(path.data(), nullptr, nullptr, 0644));
  for (const int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    const FailingCall copy(Call::strdup, ENOMEM, nth);
    Owners owners;
    EXPECT_TRUE(owners.get(path));
    ASSERT_TRUE(copy.fired());
    // The group is copied first.
    EXPECT_EQ(owners.group == nullptr, nth == 1);
    EXPECT_EQ(owners.owner == nullptr, nth == 2);
    EXPECT_EQ(owners.mode, 0100644U);
  }
}

}  // namespace
