// The commands of the families "user" and "group".
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <string>

#include "tool.h"
#include "tool_edits.h"
#include "world.h"

namespace {

// Runs the body with these accounts only.
void withAccounts(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\nshadow: files\n");
              writeFile("/etc/passwd",
                        "root:x:0:0::/root:/bin/sh\n"
                        "ann:x:5001:6001::/srv/ann:/bin/sh\n"
                        "bob:x:5002:6999::/HOME:/bin/sh\n"
                        "locked:x:5003:6001::/:/bin/false\n"
                        "nobody:x:65534:65534::/:/bin/false\n");
              writeFile("/etc/group",
                        "root:x:0:\nstaff:x:6001:bob,Zoe\nempty:x:6002:\nnogroup:x:65534:\n");
              writeFile("/etc/shadow",
                        "root:*:19000:0:99999:7:::\nann:*:19000:0:99999:7:::\n"
                        "locked:*:19000:0:99999:7:::\n");
              body();
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(Accounts, AnswersQuestionsAboutUsers) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    expectAnswer(osutils({"user", "exists", "ann"}), "USER  EXISTS\nann   true\n");
    expectNo(osutils({"user", "exists", "Ann"}), "USER  EXISTS\nAnn   false\n");
    expectNo(osutils({"user", "exists", "--json", ""}), "{\"user\":\"\",\"exists\":false}\n");
    expectAnswer(osutils({"user", "home", "ann"}), "USER  HOME\nann   /srv/ann\n");
    expectAnswer(osutils({"user", "home", "--json", "bob"}),
                 "{\"user\":\"bob\",\"home\":\"/home/bob\"}\n");
    expectAnswer(osutils({"user", "group", "--json", "ann"}),
                 "{\"user\":\"ann\",\"group\":\"staff\"}\n");
  });
}

TEST(Accounts, ReportsAnUnknownUserAndAGroupWithoutAName) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    for (const std::string command : {"home", "group"}) {
      for (const std::string name : {"", "Ann", "a\033b"}) {
        SCOPED_TRACE(command + name);
        expectFailure(osutils({"user", command, name}),
                      "osutils: user " + command + ": no such object (32): there is no user \"" +
                          (name == "a\033b" ? "a?b" : name) + "\"\n");
      }
    }
    expectFailure(osutils({"user", "group", "bob"}),
                  "osutils: user group: no such object (32): the primary group of \"bob\" is 6999, "
                  "which has no name\n");
  });
}

TEST(Accounts, AnswersQuestionsAboutGroups) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    expectAnswer(osutils({"group", "exists", "staff"}), "GROUP  EXISTS\nstaff  true\n");
    expectNo(osutils({"group", "exists", "--json", "crew"}),
             "{\"group\":\"crew\",\"exists\":false}\n");
    expectAnswer(osutils({"group", "members", "staff"}), "MEMBER\nbob\nZoe\n");
    expectAnswer(osutils({"group", "members", "--json", "staff"}),
                 "[{\"member\":\"bob\"},{\"member\":\"Zoe\"}]\n");
    expectAnswer(osutils({"group", "members", "empty"}), "");
    expectAnswer(osutils({"group", "members", "--json", "empty"}), "[]\n");
    expectFailure(osutils({"group", "members", "crew"}),
                  "osutils: group members: no such object (32): there is no group \"crew\"\n");
    // listed, listed in another case, by primary group, not a member
    expectAnswer(osutils({"group", "has", "staff", "bob"}),
                 "GROUP  USER  MEMBER\nstaff  bob   true\n");
    expectAnswer(osutils({"group", "has", "--json", "staff", "zoe"}),
                 "{\"group\":\"staff\",\"user\":\"zoe\",\"member\":true}\n");
    expectAnswer(osutils({"group", "has", "--json", "staff", "ann"}),
                 "{\"group\":\"staff\",\"user\":\"ann\",\"member\":true}\n");
    expectNo(osutils({"group", "has", "staff", "root"}),
             "GROUP  USER  MEMBER\nstaff  root  false\n");
    expectFailure(osutils({"group", "has", "--json", "crew", "ann"}),
                  "osutils: group has: no such object (32): there is no group \"crew\"\n");
  });
}

// An account that cannot be looked up is not one that does not exist.
TEST(Accounts, ALookUpThatFailsIsNoAnswer) {
  const auto with_fault = [](int error) {
    return [error] { withFault(("lookup " + std::to_string(error)).c_str()); };
  };
  for (const int error : {EINTR, EIO, EMFILE, ENFILE, ENOMEM, ERANGE}) {
    const std::string why = std::string(": ") + strerror(error) + "\n";
    expectFailure(
        osutils({"user", "exists", "root"}, with_fault(error)),
        "osutils: user exists: operations error (1): cannot look up the user \"root\"" + why);
    expectFailure(
        osutils({"group", "exists", "root"}, with_fault(error)),
        "osutils: group exists: operations error (1): cannot look up the group \"root\"" + why);
  }
  for (const int error : {EPERM, ENOENT, ESRCH, EBADF}) {  // as look-ups of what does not exist set
    expectNo(osutils({"user", "exists", "root"}, with_fault(error)), "USER  EXISTS\nroot  false\n");
    expectNo(osutils({"group", "exists", "root"}, with_fault(error)),
             "GROUP  EXISTS\nroot   false\n");
  }
  const auto at_first = [] { withFault("first lookup"); };
  expectFailure(osutils({"user", "exists", "root"}, at_first),
                "osutils: user exists: operations error (1): cannot look up the user \"root\"\n");
  expectFailure(osutils({"group", "exists", "root"}, at_first),
                "osutils: group exists: operations error (1): cannot look up the group \"root\"\n");
}

TEST(Accounts, AMemberThatCannotBeLookedUpIsNotMissing) {
  REQUIRE_ROOT("to have accounts of its own");
  withAccounts([] {
    for (const std::string user : {"bob", "zoe", "ann"}) {
      expectFailure(
          osutils({"group", "has", "staff", user}, [] { withFault("second group lookup"); }),
          "osutils: group has: operations error (1): cannot look up whether \"" + user +
              "\" is in the group \"staff\"\n");
    }
    expectNo(osutils({"group", "has", "staff", "root"}, [] { withFault("second group lookup"); }),
             "GROUP  USER  MEMBER\nstaff  root  false\n");
  });
}

TEST(Accounts, AGroupThatIsRemovedMeanwhileHasNoMembers) {
  expectNo(osutils({"group", "has", "root", "root"}, [] { withFault("later group lookups"); }),
           "GROUP  USER  MEMBER\nroot   root  false\n");
}

TEST(Accounts, ValidTriesTheAccountOutAsRoot) {
  REQUIRE_ROOT("to have accounts of its own");
  if (access("/bin/su", X_OK) != 0) GTEST_SKIP() << "needs /bin/su";
  withAccounts([] {
    for (const char* const logs : {"/run", "/var/log"}) {  // su writes logs there
      ASSERT_EQ(mount("osutils-test", logs, "tmpfs", 0, "mode=0755"), 0) << logs;
    }
    expectAnswer(osutils({"user", "valid", "ann"}), "USER  CODE\nann   0\n");
    expectFailure(
        osutils({"user", "valid", "locked"}),
        "osutils: user valid: invalid credentials (49): \"locked\" is not a valid user\n");
    expectFailure(osutils({"user", "valid", "--json", "zoe"}),
                  "osutils: user valid: no such object (32): \"zoe\" is not a valid user\n");
    expectFailure(osutils({"user", "valid", "ann;true"}),
                  "osutils: user valid: parameter error (89): \"ann;true\" is not a valid user\n");
  });
}

TEST(Accounts, ValidRefusesANameThatAShellWouldNotTakeAsItStands) {
  for (const std::string name : {"", "ann b", "ann\tb", "#ann", "-h", "ann --help"}) {
    SCOPED_TRACE(name);
    std::string shown = name;
    std::replace(shown.begin(), shown.end(), '\t', '?');
    expectFailure(
        osutils({"user", "valid", "--", name}),
        "osutils: user valid: parameter error (89): the name is not a plain shell word: \"" +
            shown + "\"\n");
  }
}

TEST(Accounts, ForAnotherUserAnAccountThatExistsIsValid) {
  REQUIRE_OTHER_USERS();
  withAccounts([] {
    asNobody([] {
      expectAnswer(osutils({"user", "valid", "--json", "locked"}, dropCoverageCounters),
                   "{\"user\":\"locked\",\"code\":0}\n");
      expectFailure(osutils({"user", "valid", "zoe"}, dropCoverageCounters),
                    "osutils: user valid: no such object (32): \"zoe\" is not a valid user\n");
    });
  });
}

}  // namespace
