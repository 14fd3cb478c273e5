// The user and group commands: they query the account database.
#include <strings.h>

#include <memory>

#include "command.h"

namespace accounts {
namespace {

struct Options {
  std::string user;
  std::string group;
};

Answer userExists(Options& options) {
  return {{"user", options.user}, {"exists", ::userExists(options.user)}};
}

Answer userValid(Options& options) {
  // For root the library passes the name to su, unquoted. It refuses shell metacharacters itself,
  // but not a blank, a "#" or a leading "-".
  if (!isShellWord(options.user) && !checkForMetaChars(options.user.data())) {
    throw notShellWord("name", options.user);
  }
  const int code = isValidUser(options.user.c_str(), nullptr);
  if (code != OSUTILS_SUCCESS) throw Failure(code, inQuotes(options.user) + " is not a valid user");
  return {{"user", options.user}, {"code", code}};
}

Answer userHome(Options& options) {
  requireUser(options.user);
  return {{"user", options.user}, {"home", orNoMemory(osutils::getUserHomeDir(options.user))}};
}

Answer userGroup(Options& options) {
  const std::optional<std::string> group = osutils::getUsersPrimaryGroup(options.user);
  if (!group) {
    requireUser(options.user);
    throw Failure(OSUTILS_NO_SUCH_OBJECT,
                  "the primary group of " + inQuotes(options.user) + " is " +
                      std::to_string(vra_get_usr_gid(options.user.c_str())) +
                      ", which has no name");
  }
  return {{"user", options.user}, {"group", *group}};
}

Answer groupExists(Options& options) {
  return {{"group", options.group}, {"exists", ::groupExists(options.group)}};
}

Answer groupMembers(Options& options) {
  requireGroup(options.group);
  const auto members = osutils::vra_getgrnam_mem(options.group);
  if (!members) throw std::bad_alloc();
  Answer list = Answer::array();
  for (const std::string& member : *members) {
    const Answer object = {{"member", member}};
    list.push_back(object);
  }
  return list;
}

// What isMemberOfGroup returns, but fails if a look-up fails.
bool isMember(const std::string& user, const std::string& group) {
  const ::group* const entry = findGroup(group);
  if (entry == nullptr) return false;
  for (char** member = entry->gr_mem; *member != nullptr; ++member) {
    if (strcasecmp(*member, user.c_str()) == 0) return true;
  }
  const passwd* const account = findUser(user);
  const ::group* const primary = account == nullptr ? nullptr : findGroup(account->pw_gid);
  return primary != nullptr && strcasecmp(primary->gr_name, group.c_str()) == 0;
}

Answer groupHas(Options& options) {
  requireGroup(options.group);
  const bool is_member = isMemberOfGroup(options.user.c_str(), options.group.c_str());
  if (!is_member && isMember(options.user, options.group)) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot look up whether " + inQuotes(options.user) +
                                                " is in the group " + inQuotes(options.group));
  }
  return {{"group", options.group}, {"user", options.user}, {"member", is_member}};
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  const Tool::Argument user_name = {"NAME", &options->user, "The user's name", kUser};
  const Tool::Argument group_name = {"NAME", &options->group, "The group's name", kGroup};

  Command& user = tool.family("user", "Check and look up users");
  tool.question(user, "exists", "Ask whether the user exists", bound(options, userExists),
                {user_name});
  tool.command(user, "valid",
               "Check that the account can be used. Root tries it with su; other users\n"
               "only check that it exists",
               bound(options, userValid), {user_name});
  tool.command(user, "home", "Show the home directory", bound(options, userHome), {user_name});
  tool.command(user, "group", "Show the primary group", bound(options, userGroup), {user_name});

  Command& group = tool.family("group", "Check and look up groups");
  tool.question(group, "exists", "Ask whether the group exists", bound(options, groupExists),
                {group_name});
  tool.command(group, "members",
               "List the users that the group's entry names; users who only have it as\n"
               "their primary group are not listed",
               bound(options, groupMembers), {group_name});
  tool.question(group, "has",
                "Ask whether the user is a member or has it as the primary group.\n"
                "Case matters in the group's name, not in its members' names",
                bound(options, groupHas),
                {{"GROUP", &options->group, "The group's name", kGroup},
                 {"USER", &options->user, "The user's name", kUser}});
}

}  // namespace accounts
