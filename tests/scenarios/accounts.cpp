// Account look-ups, users and groups.

#include <grp.h>
#include <pwd.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <utility>

#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

constexpr long kTmpfs = 0x01021994;

constexpr Kinds kPrinting = kPrint | kMemory;
constexpr Kinds kFinding = kLookup | kLock;
constexpr Kinds kCopying = kFinding | kMemory;

// The members need more than the 1024 bytes that the C library tries first.
std::string manyMembers() {
  std::string members;
  for (int number = 10; number < 34; ++number) {
    members += (number == 10 ? "" : ",") + std::string("osu_member_") + std::to_string(number) +
               std::string(40, 'x');
  }
  return members;
}

const std::string& users() {
  static const std::string lines =
      "osu_user:x:54001:54001::/srv/osu_user:/bin/false\n"
      "osu_based:x:54002:54002::/HOME:/bin/false\n"
      "osu_stray:x:54003:54999::/srv/osu_stray:/bin/false\n";
  return lines;
}

// Without this su waits before it refuses.
constexpr const char kPasswords[] = "osu_user:*:19000:0:99999:7:::\n";

const std::string& groups() {
  static const std::string lines = "osu_group:x:54001:\nosu_listed:x:54002:osu_first,osu_user\n" +
                                   ("osu_many:x:54003:" + manyMembers()) + "\n";
  return lines;
}

// A reader always finds a complete file.
void append(const std::string& file, const std::string& lines, mode_t mode) {
  std::ifstream in(file);
  const std::string old{std::istreambuf_iterator<char>(in), {}};
  if (old.ends_with(lines)) return;
  const std::string next = file + ".osu" + std::to_string(getpid());
  std::ofstream(next) << old << (old.empty() || old.ends_with('\n') ? "" : "\n") << lines;
  if (chmod(next.c_str(), mode) != 0 || rename(next.c_str(), file.c_str()) != 0) abort();
}

// Adds the accounts to /etc, which must be a private copy.
void addAccounts() {
  struct statfs status;
  if (statfs("/etc", &status) != 0 || status.f_type != kTmpfs) {
    fputs("these scenarios need a private /etc\n", stderr);
    abort();
  }
  append("/etc/passwd", users(), 0644);
  append("/etc/group", groups(), 0644);
  append("/etc/shadow", kPasswords, 0600);
  endpwent();  // a failed getUserHomeDir leaves the password database open
}

bool isRoot() { return getuid() == 0; }

std::string shownAsOwn(int id, unsigned int own) {
  return id == static_cast<int>(own) ? "own" : shown(id);
}

// The name of the process's user, or the name of the user's group.
std::string ownName() {
  const passwd* const user = getpwuid(getuid());
  return user != nullptr ? user->pw_name : "";
}
unsigned int ownGroup() {
  const passwd* const user = getpwuid(getuid());
  return user != nullptr ? user->pw_gid : 0;
}
std::string ownGroupName() {
  const group* const found = getgrgid(ownGroup());
  return found != nullptr ? found->gr_name : "";
}

std::string shownAsOwn(char* text, const std::string& own) {
  return text != nullptr && own == text ? freed(text), "own" : freed(text);
}

// A scenario that changes nothing.
Scenario query(const std::string& name, const std::string& symbol, std::function<std::string()> run,
               std::vector<End> ends) {
  return {.name = name,
          .symbols = {symbol},
          .prepare = addAccounts,
          .run = std::move(run),
          .ends = std::move(ends)};
}

// ---- Look-ups ----

// A look-up of a number with this result if the mutex cannot be locked.
Scenario number(const std::string& name, const std::string& symbol, const std::string& unlocked,
                std::function<std::string()> run, const std::string& found) {
  return query(name, symbol, std::move(run),
               {{kNothing, found}, {kLookup, "-99"}, {kLock, unlocked}});
}

// One of a text.
Scenario copy(const std::string& name, const std::string& symbol, std::function<std::string()> run,
              const std::string& found) {
  return query(name, symbol, std::move(run), {{kNothing, found}, {kCopying, "null"}});
}

std::string listOfMembers() {
  std::string list = "(\"" + manyMembers() + "\")";
  for (size_t comma = 0; (comma = list.find(',', comma)) != std::string::npos;) {
    list.replace(comma, 1, "\" \"");
  }
  return list;
}

void addLookups(std::vector<Scenario>& all) {
  // Zero if the mutex cannot be locked, even for an unknown name.
  const auto byName = [&](const std::string& symbol, int (*call)(const char*), const char* name) {
    all.push_back(number(
        symbol, symbol, "0", [=] { return shown(call(name)); }, "54001"));
    all.push_back(number(
        symbol + ", unknown", symbol, "0", [=] { return shown(call("osu_none")); }, "-99"));
    // The name is refused.
    all.push_back(query(symbol + ", null", symbol, [=] { return shown(call(nullptr)); },
                        {{kNothing, "-99"}}));
    all.push_back(
        query(symbol + ", empty", symbol, [=] { return shown(call("")); }, {{kNothing, "-99"}}));
  };
  byName("vra_getpwnam_uid", vra_getpwnam_uid, "osu_user");
  byName("vra_getgrnam_gid", vra_getgrnam_gid, "osu_group");

  all.push_back(copy(
      "vra_getpwnam_homedir", "vra_getpwnam_homedir",
      [] { return freed(vra_getpwnam_homedir("osu_user")); }, "\"/srv/osu_user\""));
  all.push_back(query("vra_getpwnam_homedir, unknown", "vra_getpwnam_homedir",
                      [] { return freed(vra_getpwnam_homedir("osu_none")); },
                      {{kNothing, "null"}}));

  const std::string members = "vra_getgrnam_mem";
  all.push_back(copy(
      members, members, [] { return freed(vra_getgrnam_mem("osu_listed")); },
      "(\"osu_first\" \"osu_user\")"));
  all.push_back(copy(
      members + ", many", members, [] { return freed(vra_getgrnam_mem("osu_many")); },
      listOfMembers()));
  all.push_back(copy(
      members + ", none", members, [] { return freed(vra_getgrnam_mem("osu_group")); }, "()"));
  for (const char* const name : {"osu_none", "", static_cast<const char*>(nullptr)}) {
    const std::string shown_name = name == nullptr ? "null" : *name == '\0' ? "empty" : "unknown";
    all.push_back(query(members + ", " + shown_name, members,
                        [=] { return freed(vra_getgrnam_mem(name)); }, {{kNothing, "null"}}));
  }

  all.push_back(number(
      "vra_get_uid", "vra_get_uid", "-99", [] { return shown(vra_get_uid("osu_user")); }, "54001"));
  all.push_back(number(
      "vra_get_uid, own", "vra_get_uid", "-99",
      [] { return shownAsOwn(vra_get_uid(nullptr), getuid()); }, "own"));
  all.push_back(query("vra_get_uid, unknown", "vra_get_uid",
                      [] { return shown(vra_get_uid("osu_none")); }, {{kNothing, "-99"}}));
  all.push_back(number(
      "vra_get_usr_gid", "vra_get_usr_gid", "-99",
      [] { return shown(vra_get_usr_gid("osu_based")); }, "54002"));
  all.push_back(number(
      "vra_get_usr_gid, own", "vra_get_usr_gid", "-99",
      [] { return shownAsOwn(vra_get_usr_gid(nullptr), ownGroup()); }, "own"));
  all.push_back(query("vra_get_usr_gid, unknown", "vra_get_usr_gid",
                      [] { return shown(vra_get_usr_gid("osu_none")); }, {{kNothing, "-99"}}));
  all.push_back(copy(
      "vra_get_usr_name", "vra_get_usr_name", [] { return freed(vra_get_usr_name("osu_user")); },
      "\"osu_user\""));
  all.push_back(copy(
      "vra_get_usr_name, own", "vra_get_usr_name",
      [] { return shownAsOwn(vra_get_usr_name(nullptr), ownName()); }, "own"));
  all.push_back(query("vra_get_usr_name, unknown", "vra_get_usr_name",
                      [] { return freed(vra_get_usr_name("osu_none")); }, {{kNothing, "null"}}));

  all.push_back(number(
      "vra_getgrgid_gid", "vra_getgrgid_gid", "0", [] { return shown(vra_getgrgid_gid(54002)); },
      "54002"));
  all.push_back(number(
      "vra_getgrgid_gid, unknown", "vra_getgrgid_gid", "0",
      [] { return shown(vra_getgrgid_gid(54999)); }, "-99"));
  all.push_back(copy(
      "vra_getgrgid_name", "vra_getgrgid_name", [] { return freed(vra_getgrgid_name(54002)); },
      "\"osu_listed\""));
  all.push_back(query("vra_getgrgid_name, unknown", "vra_getgrgid_name",
                      [] { return freed(vra_getgrgid_name(54999)); }, {{kNothing, "null"}}));
}

// ---- Users and groups ----

void addGroupQueries(std::vector<Scenario>& all) {
  const std::string primary = "getUsersPrimaryGroup";
  all.push_back(copy(
      primary, primary, [] { return freed(getUsersPrimaryGroup("osu_user")); }, "\"osu_group\""));
  all.push_back(copy(
      primary + ", own", primary,
      [] { return shownAsOwn(getUsersPrimaryGroup(nullptr), ownGroupName()); }, "own"));
  all.push_back(query(primary + ", without a group", primary,
                      [] { return freed(getUsersPrimaryGroup("osu_stray")); },
                      {{kNothing, "null"}}));
  all.push_back(query(primary + ", unknown", primary,
                      [] { return freed(getUsersPrimaryGroup("osu_none")); },
                      {{kNothing, "null"}}));

  const auto membership = [&](const std::string& variant, const char* user, const char* group) {
    return query("isMemberOfGroup, " + variant, "isMemberOfGroup",
                 [=] { return shown(isMemberOfGroup(user, group)); },
                 {{kNothing, "true"}, {kCopying, "false"}});
  };
  all.push_back(membership("listed", "osu_first", "osu_listed"));
  all.push_back(membership("listed in another case", "OSU_User", "osu_listed"));
  all.push_back(membership("primary", "osu_user", "osu_group"));
  all.push_back(query("isMemberOfGroup, own", "isMemberOfGroup",
                      [] { return shown(isMemberOfGroup(nullptr, ownGroupName().c_str())); },
                      {{kNothing, "true"}, {kCopying, "false"}}));
  const auto other = [&](const std::string& variant, const char* user, const char* group) {
    return query("isMemberOfGroup, " + variant, "isMemberOfGroup",
                 [=] { return shown(isMemberOfGroup(user, group)); }, {{kNothing, "false"}});
  };
  all.push_back(other("not a member", "osu_user", "osu_many"));
  all.push_back(other("unknown user", "osu_none", "osu_listed"));
  all.push_back(other("unknown group", "osu_user", "osu_none"));
  all.push_back(other("null group", "osu_user", nullptr));
  all.push_back(other("own user, not a member", nullptr, "osu_listed"));
}

void addExistence(std::vector<Scenario>& all) {
  const auto existence = [&](const std::string& symbol, bool (*call)(const char*),
                             const char* name) {
    all.push_back(query(symbol, symbol, [=] { return shown(call(name)); },
                        {{kNothing, "true"}, {kLookup, "false"}}));
    // Without the lock everybody exists.
    all.push_back(query(symbol + ", unknown", symbol, [=] { return shown(call("osu_none")); },
                        {{kNothing, "false"}, {kLock, "true"}}));
    all.push_back(
        query(symbol + ", empty", symbol, [=] { return shown(call("")); }, {{kNothing, "false"}}));
    all.push_back(query(symbol + ", null", symbol, [=] { return shown(call(nullptr)); },
                        {{kNothing, "false"}}));
  };
  existence("doesUserExist", doesUserExist, "osu_user");
  existence("doesGroupExist", doesGroupExist, "osu_group");
}

void addHomes(std::vector<Scenario>& all) {
  const std::string symbol = "getUserHomeDir";
  // The open password database stays if there is no result. It may be impossible to open.
  const End unopened = {kOpen, "null"};
  const auto home = [&](const std::string& variant, const char* user, const std::string& result,
                        Kinds failures) {
    return query(symbol + variant, symbol, [=] { return freed(getUserHomeDir(user)); },
                 {{kNothing, result}, {failures, "null", "", {0, 1}}, unopened});
  };
  all.push_back(home("", "osu_user", "\"/srv/osu_user\"", kCopying));
  all.push_back(home(", /home alone", "osu_based", "\"/home/osu_based\"", kCopying | kPrint));
  all.push_back(query(symbol + ", unknown", symbol,
                      [] { return freed(getUserHomeDir("osu_none")); },
                      {{kNothing, "null", "", {0, 1}}, unopened}));
  all.push_back(query(symbol + ", null", symbol, [] { return freed(getUserHomeDir(nullptr)); },
                      {{kNothing, "null"}}));
}

void addValidity(std::vector<Scenario>& all) {
  const auto validity = [&](const std::string& variant, const char* user, const void* extra,
                            std::vector<End> ends) {
    all.push_back(query(
        "isValidUser, " + variant, "isValidUser", [=] { return shown(isValidUser(user, extra)); },
        std::move(ends)));
  };
  static const Expected refused_by_su(
      [](const std::string& result) { return result == (isRoot() ? "49" : "0"); });
  validity("usable", "root", nullptr,
           {{kNothing, "0"}, {kPrinting, "80"}, {kLookup, "32"}, {kProcess, "49"}});
  // Only root runs su, and only if "root" can be looked up.
  validity("without a shell", "osu_user", nullptr,
           {{kNothing, refused_by_su}, {kPrinting, "80"}, {kLookup, "32"}, {kLookup, "0"}});
  // Without the lock everybody exists.
  validity("unknown", "osu_none", nullptr,
           {{kNothing, "32"}, {kLock, refused_by_su}, {kLock, "80"}});
  validity("metacharacter", "osu;user", nullptr, {{kNothing, "89"}});
  validity("null", nullptr, nullptr, {{kNothing, "89"}});
  validity("null user", nullptr, "", {{kNothing, "32"}});
}

}  // namespace

std::vector<Scenario> accountScenarios() {
  std::vector<Scenario> all;
  addLookups(all);
  addGroupQueries(all);
  addExistence(all);
  addHomes(all);
  addValidity(all);
  return all;
}

}  // namespace scenarios
