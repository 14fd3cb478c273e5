// Fixture of the tests of users and groups.
#pragma once

#include <gtest/gtest.h>
#include <pwd.h>
#include <stdlib.h>
#include <unistd.h>

#include <functional>
#include <regex>
#include <string>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "trails.h"
#include "world.h"

constexpr uid_t kAnn = 1001;
constexpr gid_t kStaff = 2001;
constexpr gid_t kMusic = 2002;
constexpr uid_t kUnknown = 1999;
constexpr uid_t kFar = 3000000000;
constexpr int kManyMembers = 20000;

constexpr char kPasswd[] =
    "root:x:0:0:root:/root:/bin/sh\n"
    "ann:x:1001:2001:Ann:/home/ann:/bin/sh\n"
    "stray:x:1002:2999:Stray:/home/stray:/bin/sh\n"
    "far:x:3000000000:3000000001:Far:/home/far:/bin/sh\n";

inline std::string groupFile() {
  std::string many = "many:x:2004:member0";
  for (int i = 1; i < kManyMembers; ++i) many += ",member" + std::to_string(i);
  return "root:x:0:\n"
         "staff:x:2001:zed,ann,bob\n"
         "music:x:2002:\n"
         "far:x:3000000001:\n" +
         many + "\n";
}

// Runs the body in a child process for which only the accounts above exist.
inline void withAccounts(const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\n");
              writeFile("/etc/passwd", kPasswd);
              writeFile("/etc/group", groupFile());
              body();
              return 0;
            }),
            0);
}

inline void asUserExpecting(uid_t uid, const std::function<void()>& body) {
  EXPECT_EQ(asUser(uid,
                   [&] {
                     body();
                     return 0;
                   }),
            0);
}

// Returns a copy of the string and frees the original.
inline std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

// Returns a copy of the list and frees the original.
inline std::vector<std::string> taken(char** owned) {
  if (owned == nullptr) return {"(none)"};
  std::vector<std::string> texts;
  for (char** entry = owned; *entry != nullptr; ++entry) texts.push_back(taken(*entry));
  free(static_cast<void*>(owned));
  return texts;
}

#define REQUIRE_ACCOUNTS() REQUIRE_ROOT("for a private /etc with its own accounts")

constexpr char kMorePasswd[] =
    "bare:x:1010:2001:Bare:/home:/bin/sh\n"
    "upper:x:1011:2001:Upper:/HOME:/bin/sh\n"
    "slash:x:1012:2001:Slash:/home/:/bin/sh\n"
    "longer:x:1013:2001:Longer:/homes:/bin/sh\n"
    "below:x:1014:2001:Below:/home/bare/home:/bin/sh\n"
    "empty:x:1015:2001:Empty::/bin/sh\n"
    "minus:x:4294967197:4294967197:Minus:/home/minus:/bin/sh\n";

// "STAFF" is not "staff", and is not the primary group of any user.
constexpr char kMoreGroups[] =
    "STAFF:x:2005:\n"
    "choir:x:2006:Carl,ann,zed\n"
    "minus:x:4294967197:\n";

inline void withMoreAccounts(const std::function<void()>& body) {
  withAccounts([&] {
    writeFile("/etc/passwd", std::string(kPasswd) + kMorePasswd);
    writeFile("/etc/group", groupFile() + kMoreGroups);
    body();
  });
}

// The trail, with "*" in place of the pointers in the messages of look-ups.
inline Trail trailOf(const Records& records) {
  static const std::regex pointer("(dir|ret_name|ret_grpList)=-?[1-9][0-9]*");
  Trail trail = records.trail();
  for (std::string& line : trail) line = std::regex_replace(line, pointer, "$1=*");
  return trail;
}

// Counts the library's look-ups in the account database since construction.
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
