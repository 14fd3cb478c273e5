// Command-line parsing: which words are commands and options, and that all others reach the library
// unchanged.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <iterator>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// Texts that a parser might split, join, unescape or misread.
const std::vector<std::string> kTexts = {
    "[\"x\"]", "",          "--",      "-x",    "\377\200,",
#ifndef SANITIZER_OWNS_MALLOC  // there, thousands of runs of the tool would take minutes
    "[a,b]",   "[[a],[b]]", "{}",      "a,b",   "-",         "--json", "'q'",
    "\"a b\"", "\\",        "\\u0041", "a\\ b", "--file=a",  "a=b",    "%%",
#endif
};

class TypedText : public ::testing::Test {
 protected:
  // Runs in the scratch directory: a text may be the name of a file.
  Result here(Arguments arguments) const {
    return osutils(std::move(arguments), [this] { (void)!chdir(temp.path().c_str()); });
  }

  const TempDir temp;
  const std::string services = temp.file("services", "ssh 22/tcp\n");
  const std::string inittab = temp.file("inittab", "id:2:initdefault:x\n");
};

// The arguments with the text between them.
Arguments with(const Arguments& before, const std::string& text, const Arguments& after) {
  Arguments arguments = before;
  arguments.push_back(text);
  arguments.insert(arguments.end(), after.begin(), after.end());
  return arguments;
}

// The command lines that pass the text, with and without "--".
std::vector<Arguments> spellings(const Arguments& words, const Arguments& texts_before,
                                 const std::string& text, const Arguments& after) {
  std::vector<Arguments> all;
  Arguments typed = words;
  if (!texts_before.empty() || !text.starts_with('-')) {
    typed.insert(typed.end(), texts_before.begin(), texts_before.end());
    all.push_back(with(typed, text, after));
  }
  typed = words;
  typed.push_back("--");
  typed.insert(typed.end(), texts_before.begin(), texts_before.end());
  all.push_back(with(typed, text, after));
  return all;
}

bool isUtf8(const std::string& text) { return text.find('\377') == std::string::npos; }

TEST_F(TypedText, EveryAnswerHasTheTextAsItWasTyped) {
  struct Case {
    Arguments words;
    Arguments before;
    Arguments after;
    std::string key;
  };
  const Case cases[] = {
      {{"file", "stat"}, {}, {}, "path"},
      {{"dir", "trim"}, {}, {}, "path"},
      {{"user", "exists"}, {}, {}, "user"},
      {{"group", "exists"}, {}, {}, "group"},
      {{"group", "has"}, {"root"}, {}, "user"},
      {{"name", "check"}, {}, {}, "name"},
      {{"screen"}, {}, {}, "text"},
      {{"dn", "compare"}, {}, {"a=b"}, "a"},
      {{"dn", "compare"}, {"a=b"}, {}, "b"},
      {{"dn", "format"}, {}, {}, "name"},
  };
  for (const Case& each : cases) {
    for (const std::string& text : kTexts) {
      if (text.empty() && each.words.back() == "format") continue;  // refused
      Arguments words = each.words;
      words.insert(words.begin(), "--json");
      for (const Arguments& typed : spellings(words, each.before, text, each.after)) {
        SCOPED_TRACE(::testing::PrintToString(typed));
        const Result result = here(typed);
        EXPECT_TRUE(result.status == 0 || result.status == 1) << result.err;
        EXPECT_EQ(result.err, "");
        if (!isUtf8(text)) continue;
        auto answer = nlohmann::json::parse(result.out);
        if (answer.is_array()) {
          EXPECT_EQ(answer.size(), 1U);
          answer = answer[0];
        }
        EXPECT_EQ(answer[each.key], text);
      }
      for (const Arguments& typed : spellings(each.words, each.before, text, each.after)) {
        EXPECT_THAT(here(typed).out, HasSubstr(text));  // also bytes that are not UTF-8
      }
    }
  }
}

TEST_F(TypedText, EveryFailureNamesTheTextAsItWasTyped) {
  struct Case {
    Arguments words;
    Arguments before;
    Arguments after;
    std::string line;  // a ? stands for the text
  };
  const Case cases[] = {
      {{"file", "check"}, {}, {}, ": ?\n"},
      {{"file", "copy"}, {}, {"copy"}, "cannot copy ? to copy"},
      {{"file", "copy"}, {"missing"}, {}, "cannot copy missing to ?;"},
      {{"file", "delete"}, {}, {}, "cannot delete ?;"},
      {{"file", "owner"}, {}, {}, "the owner and group of ?;"},
      {{"dir", "delete"}, {}, {}, "cannot delete ?;"},
      {{"space"}, {"0"}, {}, "the free space at ?;"},
      {{"space"}, {}, {"."}, "MIB is not a whole number: \"?\"\n"},
      {{"user", "home"}, {}, {}, "there is no user \"?\"\n"},
      {{"user", "group"}, {}, {}, "there is no user \"?\"\n"},
      {{"group", "members"}, {}, {}, "there is no group \"?\"\n"},
      {{"group", "has"}, {}, {"root"}, "there is no group \"?\"\n"},
      {{"services", "port", "--file", services}, {}, {}, " has no service \"?\"\n"},
      {{"services", "add", "--file", services}, {"a"}, {}, "PORT is not a whole number: \"?\"\n"},
      {{"services", "free-port", "--file", services},
       {},
       {},
       "START is not a whole number: \"?\"\n"},
      {{"inittab", "delete", "--file", inittab}, {}, {}, " has no entry \"?\"\n"},
      {{"process", "stop"}, {}, {}, "PID is not a process id: \"?\"\n"},
      {{"process", "status"}, {}, {"a"}, "PID is not a process id: \"?\"\n"},
      {{"module", "check"}, {"libc.so.6"}, {}, "libc.so.6 has no symbol \"?\"\n"},
  };
  for (const Case& each : cases) {
    for (const std::string& text : kTexts) {
      std::string line = each.line;
      line.replace(line.find('?'), 1, text);
      for (const Arguments& typed : spellings(each.words, each.before, text, each.after)) {
        SCOPED_TRACE(::testing::PrintToString(typed));
        expectFailure(here(typed), HasSubstr(line));
      }
    }
  }
}

// Commands that take some of the texts and refuse others.
TEST_F(TypedText, TheAnswerOrTheLineHasTheTextAsItWasTyped) {
  REQUIRE_ROOT("to be without a network");
  struct Case {
    Arguments words;
    Arguments before;
    Arguments after;
  };
  const Case cases[] = {
      {{"user", "valid"}, {}, {}},
      {{"process", "status"}, {"2147483647"}, {}},
      {{"module", "check"}, {}, {}},
      {{"net", "resolve"}, {}, {}},
      {{"services", "add", "--dry-run", "--file", services}, {}, {"1"}},
      {{"services", "delete", "--file", services}, {}, {}},
      {{"inittab", "add", "--dry-run", "--file", inittab}, {}, {"2", "wait", "x"}},
      {{"inittab", "add", "--dry-run", "--file", inittab}, {"a"}, {"wait", "x"}},
      {{"inittab", "add", "--dry-run", "--force", "--file", inittab}, {"a", "2"}, {"x"}},
  };
  EXPECT_EQ(
      withPrivateNetwork([&] {
        for (const Case& each : cases) {
          for (const std::string& text : kTexts) {
            for (const Arguments& typed : spellings(each.words, each.before, text, each.after)) {
              SCOPED_TRACE(::testing::PrintToString(typed));
              const Result result = here(typed);
              EXPECT_THAT(result.out + result.err, HasSubstr(text));
              EXPECT_THAT(result.err, ::testing::Not(::testing::ContainsRegex(
                                          "unknown option|unexpected argument|is missing|Usage:")));
            }
          }
        }
        return ::testing::Test::HasFailure() ? 1 : 0;
      }),
      0);
}

TEST_F(TypedText, AnOptionsValueIsTheTextAsItWasTyped) {
  struct Case {
    Arguments words;
    std::string option;
    Arguments after;
    std::string line;
  };
  const Case cases[] = {
      {{"services", "list"}, "--file", {}, "cannot read ?\n"},
      {{"inittab", "list"}, "--file", {}, "cannot read ?\n"},
      {{"file", "create"}, "--owner", {"x"}, "there is no user \"?\"\n"},
      {{"dir", "create"}, "--group", {"x"}, "there is no group \"?\"\n"},
      {{"file", "copy"}, "--mode", {"x", "y"}, "mode from 0 to 7777: \"?\"\n"},
      {{"db"}, "--migration", {}, "found in ?/etc/xq4info;"},
  };
  for (const Case& each : cases) {
    for (const std::string& text : kTexts) {
      std::string line = each.line;
      line.replace(line.find('?'), 1, text);
      Arguments apart = each.words;
      apart.insert(apart.end(), {each.option, text});
      Arguments together = each.words;
      together.push_back(each.option + "=" + text);
      for (Arguments typed : {apart, together}) {
        SCOPED_TRACE(::testing::PrintToString(typed));
        typed.insert(typed.end(), each.after.begin(), each.after.end());
        expectFailure(here(typed), HasSubstr(line));
      }
    }
  }
}

TEST_F(TypedText, FilesAndDirectoriesGetTheNameThatWasTyped) {
  for (const std::string& text : kTexts) {
    if (text.empty()) continue;
    SCOPED_TRACE(text);
    const std::string path = temp.path(text);
    EXPECT_EQ(here({"file", "create", "--", text}).status, 0);
    EXPECT_TRUE(std::filesystem::is_regular_file(path));
    EXPECT_EQ(here({"file", "copy", services, text}).status, 0);
    EXPECT_EQ(contentsOf(path), "ssh 22/tcp\n");
    EXPECT_EQ(here({"file", "clear", "--", text}).status, 0);
    EXPECT_EQ(contentsOf(path), "");
    EXPECT_EQ(here({"file", "owner", "--mode", "0600", "--", text}).status, 0);
    EXPECT_EQ(modeOf(path), 0600U);
    EXPECT_EQ(here({"file", "delete", "--", text}).status, 0);
    EXPECT_FALSE(pathExists(path));
    EXPECT_EQ(here({"dir", "create", "--", text}).status, 0);
    EXPECT_TRUE(std::filesystem::is_directory(path));
    EXPECT_EQ(here({"dir", "delete", "--", text}).status, 0);
    EXPECT_FALSE(pathExists(path));
  }
}

TEST_F(TypedText, TheInittabGetsTheCommandThatWasTyped) {
  for (const std::string& text : kTexts) {
    SCOPED_TRACE(text);
    writeFile(inittab, "");
    EXPECT_EQ(here({"inittab", "add", "--file", inittab, "a", "2", "wait", text}).status, 0);
    EXPECT_EQ(contentsOf(inittab), "a:2:wait:" + text + "\n");
    EXPECT_EQ(here({"inittab", "find", "--file", inittab, "--", text}).status, 0);
    EXPECT_EQ(here({"inittab", "find", "--file", inittab, "--", text + "~"}).status, 3);
  }
}

TEST_F(TypedText, TheLauncherGetsTheArgumentsThatWereTyped) {
  const std::string launcher = temp.file("vrarun", "#!/bin/sh\nprintf '<%s>' \"$@\" > written\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0755), 0);
  for (const std::string& text : kTexts) {
    const bool is_refused = text.empty() || text.find_first_of("[]{}\"'`\\ ") != std::string::npos;
    for (const Arguments& typed :
         spellings({"process", "start", "--launcher-dir", temp.path()}, {}, text, {"-n"})) {
      SCOPED_TRACE(::testing::PrintToString(typed));
      writeFile(temp.path("written"), "");
      const Result result = here(typed);
      if (is_refused) {
        expectFailure(result, AllOf(StartsWith("osutils: process start: parameter error (89): "),
                                    HasSubstr("\"" + text)));
        EXPECT_EQ(contentsOf(temp.path("written")), "");
      } else {
        EXPECT_EQ(result.status, 0) << result.err;
        EXPECT_EQ(contentsOf(temp.path("written")), "<" + text + "><-n>");
      }
    }
  }
}

TEST_F(TypedText, OnlyTheFirstDashesAreRemovedAndNothingIsReordered) {
  const auto texts = [this](Arguments arguments) {
    arguments.insert(arguments.begin(), {"screen", "--json"});
    std::vector<std::string> shown;
    for (const auto& each : nlohmann::json::parse(here(arguments).out)) {
      shown.push_back(each["text"]);
    }
    return shown;
  };
  EXPECT_EQ(texts({"--", "--", "a", "--"}), (Arguments{"--", "a", "--"}));
  EXPECT_EQ(texts({"a", "--", "b"}), (Arguments{"a", "--", "b"}));
  EXPECT_EQ(texts({"b", "--trace", "a", "--json"}), (Arguments{"b", "--trace", "a", "--json"}));
  EXPECT_EQ(texts({"", "-x"}), (Arguments{"", "-x"}));
  EXPECT_EQ(texts({"screen", "screen"}), (Arguments{"screen", "screen"}));
}

TEST_F(TypedText, CommonOptionsStandBeforeOrAfterTheCommand) {
  const std::string answer = "{\"port\":22}\n";
  for (const Arguments& words :
       {Arguments{"--json", "services", "port"}, Arguments{"services", "--json", "port"},
        Arguments{"services", "port", "--json"},
        Arguments{"--json", "services", "port", "--json"}}) {
    Arguments typed = words;
    typed.insert(typed.end(), {"--file", services, "ssh"});
    SCOPED_TRACE(::testing::PrintToString(typed));
    expectAnswer(here(typed), "{\"name\":\"ssh\",\"port\":22}\n");
  }
  const std::string trace = temp.path("trace");
  EXPECT_EQ(here({"--trace", trace, "file", "stat", "/"}).status, 0);
  EXPECT_EQ(here({"file", "--trace=" + trace, "stat", "/"}).status, 0);
  EXPECT_TRUE(pathExists(trace));
}

TEST_F(TypedText, TheTraceOptionTakesTheDirectoryFromTheEnvironment) {
  const std::string trace = temp.path("trace");
  const std::string other = temp.path("other");
  EXPECT_EQ(
      osutils({"--trace", trace, "file", "stat", "/"}, [&] { setenv("TRC_DIR", other.c_str(), 1); })
          .status,
      0);
  EXPECT_FALSE(std::filesystem::is_empty(trace));
}

struct Refusal {
  Arguments typed;
  std::string line;
};

TEST_F(TypedText, WrongUsageNamesTheWordAndASimilarKnownOne) {
  const Refusal refusals[] = {
      {{"servces"}, "unknown command \"servces\" (nearest: \"services\")\n"},
      {{""}, "unknown command \"\"\n"},
      {{"sevrces"}, "unknown command \"sevrces\" (nearest: \"services\")\n"},
      {{"serv"}, "unknown command \"serv\"\n"},
      {{"services", "lst"}, "services: @unknown command \"lst\" (nearest: \"list\")\n"},
      {{"group", "--", "has"}, "group: @a command is missing, one of: exists, members, has\n"},
      {{"file", "stat", "--jsn", "x"},
       "file stat: @unknown option \"--jsn\" (nearest: \"--json\"); put -- before an argument "
       "that begins with \"-\"\n"},
      {{"time", "--compct=1"}, "time: @unknown option \"--compct\" (nearest: \"--compact\")\n"},
      {{"time", "-"}, "time: @unknown option \"-\"\n"},
      {{"--file", "x", "services", "list"}, "unknown option \"--file\"\n"},
      {{"services", "--version"}, "services: @unknown option \"--version\"\n"},
      {{"time", "compact"},
       "time: @unexpected argument \"compact\"; \"time\" takes only options\n"},
      {{"db", "version"}, "db: @unexpected argument \"version\"; \"db\" takes only options\n"},
      {{"services", "list", "add"},
       "services list: @unexpected argument \"add\" (nearest command: \"add\"); \"services "
       "list\" takes only options\n"},
      {{"file", "delete", "x", "--jsn"},
       "file delete: @unexpected argument \"--jsn\" (nearest option: \"--json\"); \"file "
       "delete\" takes options, then PATH\n"},
      {{"file", "delete", "x", "--dry-run"},
       "file delete: @unexpected argument \"--dry-run\": options come before PATH; \"file "
       "delete\" takes options, then PATH\n"},
      {{"file", "copy", "a", "b", "--mode=600"},
       "file copy: @unexpected argument \"--mode=600\": options come before SOURCE; \"file copy\" "
       "takes options, then SOURCE DEST\n"},
      {{"time", "--", "--compact"},
       "time: @unexpected argument \"--compact\": options come before \"--\"; \"time\" takes only "
       "options\n"},
      {{"time", "--json=yes"}, "time: @--json takes no value\n"},
      {{"time", "--trace"}, "time: @--trace needs a value\n"},
      {{"--trace", "a", "time", "--trace", "b"}, "time: @--trace is given twice\n"},
      {{"db", "--instance", "a"}, "db: @--instance needs --location\n"},
      {{"group", "has", "root"}, "group has: @USER is missing\n"},
      {{"screen", "--"}, "screen: @TEXT is missing\n"},
      // As near by the number of changes: then the longest common beginning.
      {{"file", "clpy"}, "file: @unknown command \"clpy\" (nearest: \"copy\")\n"},
      {{"user", "hme"}, "user: @unknown command \"hme\" (nearest: \"home\")\n"},
      {{"paths", "--trac"}, "paths: @unknown option \"--trac\" (nearest: \"--trace\")\n"},
      {{"db", "--location", "x"}, "db: @--location needs --instance\n"},
      {{"net", "addresses", "--localhost", "--interfaces"},
       "net addresses: @--localhost excludes --interfaces\n"},
      {{"file", "copy", "a"}, "file copy: @DEST is missing\n"},
      {{"inittab", "add", "a", "b", "c", "d", "e"},
       "inittab add: @unexpected argument \"e\"; \"inittab add\" takes options, then ID RUNLEVELS "
       "ACTION PROCESS\n"},
      {{},
       "@a command is missing, one of: help, services, paths, db, file, dir, space, user, "
       "group, name, screen, time, inittab, process, platform, module, net, dn"
#ifdef READS_TRACES
       ", trace"
#endif
       "\n"},
      {{"help", "file", "stt"}, "help: @unknown command \"stt\" (nearest: \"stat\")\n"},
      {{"help", "time", "x"}, "help: @unexpected argument \"x\": \"time\" has no subcommands\n"},
  };
  for (const Refusal& each : refusals) {
    SCOPED_TRACE(::testing::PrintToString(each.typed));
    std::string line = each.line;
    const size_t at = line.find('@');
    const std::string error = "parameter error (89): ";
    line.insert(0, at == std::string::npos ? error : "");
    if (at != std::string::npos) line.replace(at, 1, error);
    const Result result = here(each.typed);
    EXPECT_EQ(result.status, 2);
    expectFailure(result, "osutils: " + line);
  }
}

TEST_F(TypedText, HelpOfACommandIsTheSameInBothWays) {
  const std::vector<Arguments> commands = {
      {}, {"file"}, {"file", "stat"}, {"services"}, {"services", "add"}, {"screen"}, {"help"}};
  for (const Arguments& command : commands) {
    SCOPED_TRACE(::testing::PrintToString(command));
    Arguments asked = command;
    asked.push_back("--help");
    Arguments short_option = command;
    short_option.push_back("-h");
    Arguments help = command;
    help.insert(help.begin(), "help");
    const Result result = here(help);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    std::string name = "osutils";
    for (const std::string& word : command) name += " " + word;
    EXPECT_THAT(result.out, HasSubstr(name + " [OPTIONS]"));
    expectAnswer(here(asked), result.out);
    expectAnswer(here(short_option), result.out);
  }
}

// ---- Usage and help ----

TEST_F(Tool, ExplainsItself) {
  expectAnswer(osutils({"--version"}), "osutils " OSUTILS_VERSION "\n");
  const Result help = osutils({"--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_THAT(help.out, AllOf(HasSubstr("services"), HasSubstr("--version")));
  EXPECT_EQ(help.err, "");
  const std::vector<std::string> commands = {"list", "add", "delete", "port", "free-port"};
  for (const std::string& command : commands) {
    SCOPED_TRACE(command);
    const Result text = osutils({"services", command, "--help"});
    EXPECT_EQ(text.status, 0);
    EXPECT_THAT(text.out, AllOf(HasSubstr("--file"), HasSubstr("--backup"), HasSubstr("--json"),
                                HasSubstr("--trace")));
    EXPECT_EQ(text.err, "");
  }
  EXPECT_THAT(osutils({"services", "delete", "--help"}).out, HasSubstr("rewritten in place"));
}

TEST_F(Tool, ReportsBadUsageInOneLine) {
  struct Case {
    Arguments arguments;
    std::string beginning;
  };
  const Case cases[] = {
      {{}, "osutils: "},
      {{"unknown"}, "osutils: "},
      {{"--unknown"}, "osutils: "},
      {{"services"}, "osutils: services: "},
      {{"services", "unknown"}, "osutils: services: "},
      {{"services", "list", "extra"}, "osutils: services list: "},
      {{"services", "list", "ex\ntra"}, "osutils: services list: "},
      {{"services", "list", "--unknown"}, "osutils: services list: "},
      {{"services", "list", "--file"}, "osutils: services list: "},
      {{"services", "list", "--json=maybe"}, "osutils: services list: "},
      {{"services", "list", "add"}, "osutils: services list: "},
      {{"services", "add"}, "osutils: services add: "},
      {{"services", "add", "vraslapd"}, "osutils: services add: "},
      {{"services", "add", "vraslapd", "3700", "extra"}, "osutils: services add: "},
      {{"services", "delete"}, "osutils: services delete: "},
      {{"services", "port"}, "osutils: services port: "},
      {{"services", "free-port", "1", "2"}, "osutils: services free-port: "},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.beginning + ::testing::PrintToString(each.arguments));
    expectFailure(osutils(each.arguments), StartsWith(each.beginning + "parameter error (89): "));
  }
}

struct Command {
  Arguments name;
  int arguments;
};

const Command kCommands[] = {
    {{"paths"}, 0},
    {{"db"}, 0},
    {{"file", "stat"}, 1},
    {{"file", "check"}, 1},
    {{"file", "copy"}, 2},
    {{"file", "create"}, 1},
    {{"file", "delete"}, 1},
    {{"file", "clear"}, 1},
    {{"file", "owner"}, 1},
    {{"dir", "create"}, 1},
    {{"dir", "delete"}, 1},
    {{"dir", "trim"}, 1},
    {{"space"}, 2},
    {{"user", "exists"}, 1},
    {{"user", "valid"}, 1},
    {{"user", "home"}, 1},
    {{"user", "group"}, 1},
    {{"group", "exists"}, 1},
    {{"group", "members"}, 1},
    {{"group", "has"}, 2},
    {{"name", "check"}, 1},
    {{"time"}, 0},
    {{"inittab", "list"}, 0},
    {{"inittab", "add"}, 4},
    {{"inittab", "delete"}, 1},
    {{"inittab", "find"}, 1},
    {{"inittab", "free-id"}, 0},
    {{"process", "stop"}, 1},
    {{"process", "status"}, 2},
    {{"platform"}, 0},
    {{"net", "addresses"}, 0},
    {{"net", "check"}, 1},
    {{"net", "resolve"}, 1},
};

TEST_F(Tool, EveryCommandWantsExactlyItsArguments) {
  for (const Command& command : kCommands) {
    std::string line = "osutils:";
    for (const std::string& word : command.name) line += " " + word;
    line += ": parameter error (89): ";
    SCOPED_TRACE(line);
    Arguments arguments = command.name;
    for (int count = 0; count <= command.arguments; ++count) {
      if (count != command.arguments) expectFailure(osutils(arguments), StartsWith(line));
      arguments.push_back(temp.path("missing"));
    }
    expectFailure(osutils(arguments), StartsWith(line));
    arguments.pop_back();
    arguments.push_back("--unknown");
    expectFailure(osutils(arguments), StartsWith(line));
  }
  expectFailure(osutils({"screen"}), StartsWith("osutils: screen: parameter error (89): "));
  expectFailure(osutils({"screen", "--unknown", "a"}),
                StartsWith("osutils: screen: parameter error (89): "));
  for (const Arguments& arguments :
       {Arguments{"process", "start"}, Arguments{"process", "start", "--unknown", "a"},
        Arguments{"process", "start", "--launcher-dir", "a"}, Arguments{"module", "check"},
        Arguments{"module", "check", "a", "b", "c"}, Arguments{"module", "check", "--unknown", "a"},
        Arguments{"dn", "format", "a", "b"}, Arguments{"dn", "format", "--unknown"},
        Arguments{"dn", "compare", "a"}, Arguments{"dn", "compare", "a", "b", "c"},
        Arguments{"net", "addresses", "--localhost", "--interfaces"}}) {
    SCOPED_TRACE(::testing::PrintToString(arguments));
    expectFailure(osutils(arguments), StartsWith("osutils: " + arguments[0] + " " + arguments[1] +
                                                 ": parameter error (89): "));
  }
  for (const std::string family :
       {"file", "dir", "user", "group", "name", "inittab", "process", "module", "net", "dn"}) {
    SCOPED_TRACE(family);
    expectFailure(osutils({family}), StartsWith("osutils: " + family + ": parameter error (89): "));
    expectFailure(osutils({family, "unknown"}),
                  StartsWith("osutils: " + family + ": parameter error (89): "));
  }
  for (const Arguments& arguments :
       {Arguments{"db", "--instance", "a"}, Arguments{"db", "--location", "b"},
        Arguments{"db", "--instance", "a", "--location", "b", "--migration", "c"},
        Arguments{"db", "--location", "b", "--migration", "c"}, Arguments{"db", "--migration"}}) {
    SCOPED_TRACE(::testing::PrintToString(arguments));
    expectFailure(osutils(arguments), StartsWith("osutils: db: parameter error (89): "));
  }
}

TEST_F(Tool, EveryCommandExplainsItself) {
  std::vector<Command> commands(std::begin(kCommands), std::end(kCommands));
  for (const Arguments& name :
       {Arguments{"screen"}, Arguments{"process", "start"}, Arguments{"module", "check"},
        Arguments{"dn", "format"}, Arguments{"dn", "compare"}}) {
    commands.push_back({name, 1});
  }
  for (const Command& command : commands) {
    SCOPED_TRACE(::testing::PrintToString(command.name));
    Arguments arguments = command.name;
    arguments.push_back("--help");
    const Result text = osutils(arguments);
    EXPECT_EQ(text.status, 0);
    EXPECT_THAT(text.out, AllOf(HasSubstr("--json"), HasSubstr("--trace"),
                                HasSubstr("The exit status is 0")));
    EXPECT_EQ(text.err, "");
  }
  for (const Arguments& question :
       {Arguments{"space", "--help"}, Arguments{"user", "exists", "--help"},
        Arguments{"group", "exists", "--help"}, Arguments{"group", "has", "--help"},
        Arguments{"name", "check", "--help"}, Arguments{"screen", "--help"},
        Arguments{"process", "status", "--help"}, Arguments{"net", "check", "--help"},
        Arguments{"dn", "compare", "--help"}}) {
    EXPECT_THAT(osutils(question).out, HasSubstr("The exit status is 0 for yes, 1 for no, "));
  }
  EXPECT_THAT(osutils({"screen", "--help"}).out, HasSubstr("[OPTIONS] TEXT...\n"));
  EXPECT_THAT(osutils({"process", "start", "--help"}).out, HasSubstr("[OPTIONS] ARGUMENT...\n"));
  EXPECT_THAT(osutils({"inittab", "delete", "--help"}).out,
              AllOf(HasSubstr("--file"), HasSubstr("--backup"), HasSubstr("rewritten in place")));
  const std::string help = osutils({"--help"}).out;
  for (const char* command :
       {"paths", "db", "file", "dir", "space", "user", "group", "name", "screen", "time", "inittab",
        "process", "platform", "module", "net", "dn"}) {
    EXPECT_THAT(help, HasSubstr("\n  " + std::string(command) + " "));
  }
}

}  // namespace
