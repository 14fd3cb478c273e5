#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <optional>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "test_usergrouputils.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAreArray;

namespace {

constexpr uid_t kStray = 1002;  // its primary group is not in /etc/group

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

// Of the path itself: a link is not followed.
Ownership ownershipOf(const std::string& path) {
  struct stat status = {};
  EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
  return {status.st_uid, status.st_gid, status.st_mode & 07777U};
}

// The records of a call with these look-ups and this result.
Trail setTrail(const Trail& inside, bool result) {
  Trail trail = {"> setFileOwnersAndPermissions"};
  trail.insert(trail.end(), inside.begin(), inside.end());
  trail.push_back(result ? "<! setFileOwnersAndPermissions 1" : "< setFileOwnersAndPermissions 0");
  return trail;
}

constexpr char kAnnsUid[] = "D vra_get_uid: name=ann uid=1001\n";
constexpr char kAnnsGid[] = "D vra_get_usr_gid: name=ann gid=2001\n";
constexpr char kAnnsGroup[] = "D vra_getgrgid_gid: gid=2001 ret_gid=2001\n";

// A temporary directory with one file, owned by root and with mode 0644, and an open descriptor of it.
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
    std::string elsewhere = file.temp.path("no such file");  // must not be changed
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

// Gives the file to ann while the change of owner fails. Without a selector, the
// descriptor of the file is passed.
void expectAfterFailedChangeOfOwner(Call change, std::optional<int> selector, bool result,
                                    const Ownership& after) {
  withAccounts([&] {
    OneFile file;
    char ann[] = "ann";
    const int descriptor = selector.value_or(file.descriptor);
    const Records records;
    const FailingCall failing(change, EIO);

    EXPECT_EQ(setFileOwnersAndPermissions(descriptor, file.path.data(), ann, nullptr, 0600),
              result);

    ASSERT_TRUE(failing.fired());
    EXPECT_EQ(ownershipOf(file.path), after);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(setTrail({kAnnsUid, kAnnsGid, kAnnsGroup, kChownFailed}, result)));
  });
}

TEST(SetFileOwners, ThroughADescriptorStopsAtAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  expectAfterFailedChangeOfOwner(Call::fchown, std::nullopt, false, kUntouched);
}

TEST(SetFileOwners, OfALinkStopsAtAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  expectAfterFailedChangeOfOwner(Call::lchown, FILE_DESC_USE_LINK_PATH, false, kUntouched);
}

TEST(SetFileOwners, ThroughAPathGoOnToTheModeAfterAFailedChangeOfOwner) {
  REQUIRE_ACCOUNTS();
  expectAfterFailedChangeOfOwner(Call::chown, FILE_DESC_USE_PATH, true, Ownership{0, 0, 0600});
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
