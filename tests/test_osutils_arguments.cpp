// The tool takes what was typed: which words are commands and options, and that all others reach the library
// byte for byte.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <nlohmann/json.hpp>

#include "tool.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// What a parser might split, join, unescape, or take for something else.
const std::vector<std::string> kTexts = {"[a,b]",    "[\"x\"]", "[[a],[b]]", "{}",       "",
                                         "a,b",      "--",      "-",         "-x",       "--json",
                                         "'q'",      "\"a b\"", "\\",        "\\u0041",  "a\\ b",
                                         "--file=a", "a=b",     "%%",        "\377\200,"};

class TypedText : public ::testing::Test {
 protected:
  // In the scratch directory, so that a text can be the name of a file.
  Result here(Arguments arguments) const {
    return osutils(std::move(arguments), [this] { (void)!chdir(temp.path().c_str()); });
  }

  const TempDir temp;
  const std::string services = temp.file("services", "ssh 22/tcp\n");
  const std::string inittab = temp.file("inittab", "id:2:initdefault:x\n");
};

// Command words, options and texts, with one text among them.
Arguments with(const Arguments& before, const std::string& text, const Arguments& after) {
  Arguments arguments = before;
  arguments.push_back(text);
  arguments.insert(arguments.end(), after.begin(), after.end());
  return arguments;
}

// The ways to type it.
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
        EXPECT_THAT(here(typed).out, HasSubstr(text));  // bytes that are no UTF-8 as well
      }
    }
  }
}

TEST_F(TypedText, EveryFailureNamesTheTextAsItWasTyped) {
  struct Case {
    Arguments words;
    Arguments before;
    Arguments after;
    std::string line;  // with a ? where the text is
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
      {{"process", "stop"}, {}, {}, "PID is not the number of a process: \"?\"\n"},
      {{"process", "status"}, {}, {"a"}, "PID is not the number of a process: \"?\"\n"},
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
                                          "unknown option|surplus argument|is missing|Usage:")));
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

TEST_F(TypedText, OptionsOfAllCommandsStandBeforeTheCommandOrBehindIt) {
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

struct Refusal {
  Arguments typed;
  std::string line;
};

TEST_F(TypedText, WrongUsageNamesTheWordAndTheNearestKnownOne) {
  const Refusal refusals[] = {
      {{"servces"}, "unknown command \"servces\", the nearest is \"services\"\n"},
      {{""}, "unknown command \"\", the nearest is \"db\"\n"},
      {{"services", "lst"}, "services: @unknown command \"lst\", the nearest is \"list\"\n"},
      {{"group", "--", "has"}, "group: @a command is missing: exists, members, has\n"},
      {{"file", "stat", "--jsn", "x"},
       "file stat: @unknown option \"--jsn\", the nearest is \"--json\"; a text that begins with "
       "\"-\" stands after --\n"},
      {{"time", "--compct=1"},
       "time: @unknown option \"--compct\", the nearest is \"--compact\"\n"},
      {{"time", "-"}, "time: @unknown option \"-\", the nearest is \"-h\"\n"},
      {{"--file", "x", "services", "list"},
       "unknown option \"--file\", the nearest is \"--help\"\n"},
      {{"services", "--version"},
       "services: @unknown option \"--version\", the nearest is \"--verbose\"\n"},
      {{"time", "compact"},
       "time: @surplus argument \"compact\", the nearest command is \"space\"; \"time\" takes "
       "options "
       "only\n"},
      {{"services", "list", "add"},
       "services list: @surplus argument \"add\", the nearest command is \"add\"; \"services "
       "list\" "
       "takes options only\n"},
      {{"file", "delete", "x", "--jsn"},
       "file delete: @surplus argument \"--jsn\", the nearest option is \"--json\"; \"file "
       "delete\" takes options before PATH\n"},
      {{"time", "--json=yes"}, "time: @--json takes no value\n"},
      {{"time", "--trace"}, "time: @--trace needs a value\n"},
      {{"--trace", "a", "time", "--trace", "b"}, "time: @--trace is given twice\n"},
      {{"db", "--instance", "a"}, "db: @--instance needs --location\n"},
      {{"group", "has", "root"}, "group has: @USER is missing\n"},
      {{"screen", "--"}, "screen: @TEXT is missing\n"},
      {{"help", "file", "stt"}, "help: @unknown command \"stt\", the nearest is \"stat\"\n"},
      {{"help", "time", "x"}, "help: @surplus argument \"x\", \"time\" is a whole command\n"},
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

}  // namespace
