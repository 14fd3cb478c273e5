// The words of the help texts. CLI11 arranges them differently in each of its versions.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tool.h"

namespace {

using ::testing::HasSubstr;

#ifdef READS_TRACES
constexpr bool kReadsTraces = true;
#else
constexpr bool kReadsTraces = false;
#endif

struct Section {
  Arguments command;
  std::vector<std::string> phrases;  // the first is the description
};

// Each section of the file begins with a line "= COMMAND".
std::vector<Section> sections() {
  std::vector<Section> found;
  std::ifstream file(HELP_TEXTS);
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with('=')) {
      std::istringstream words(line.substr(1));
      found.emplace_back();
      for (std::string word; words >> word;) found.back().command.push_back(word);
    } else if (!line.empty()) {
      found.back().phrases.push_back(line);
    }
  }
  return found;
}

// The help text with single blanks between its words, and without the marks that CLI11 adds.
std::string helpOf(const Arguments& command) {
  Arguments words = command;
  words.insert(words.begin(), "help");
  const Result help = osutils(words);
  EXPECT_EQ(help.status, 0) << help.err;
  const std::string text = std::regex_replace(help.out, std::regex("\\s+"), " ");
  return std::regex_replace(text, std::regex(" REQUIRED| \\.\\.\\.| (Needs|Excludes):( --[a-z]+)+"),
                            "");
}

TEST(Help, HasTheWordsOfEveryCommand) {
  const std::vector<Section> all = sections();
  ASSERT_GT(all.size(), 50U);
  for (const Section& section : all) {
    if (!kReadsTraces && !section.command.empty() && section.command.front() == "trace") continue;
    SCOPED_TRACE(::testing::PrintToString(section.command));
    const std::string help = helpOf(section.command);
    for (const std::string& phrase : section.phrases) EXPECT_THAT(help, HasSubstr(phrase));
    for (const char* phrase :
         {"--json Print the answer as JSON",
          "--trace DIR Record the library's calls in this directory, for babeltrace2",
          "--verbose Print the library's debug messages on standard error"}) {
      EXPECT_THAT(help, HasSubstr(phrase));
    }
    if (section.command.empty()) continue;
    const Arguments family(section.command.begin(), section.command.end() - 1);
    EXPECT_THAT(helpOf(family),
                HasSubstr(" " + section.command.back() + " " + section.phrases.at(0)));
  }
}

using Json = nlohmann::json;

const Json& named(const Json& list, const std::string& name) {
  for (const Json& item : list) {
    if (item.contains("names") ? item["names"].back() == name : item["name"] == name) return item;
  }
  static const Json kNothing = Json::object();
  return kNothing;
}

// What `osutils help --json` says about the command.
Json described(const Arguments& command) {
  Arguments words = command;
  words.insert(words.begin(), {"help", "--json"});
  const Result help = osutils(words);
  EXPECT_EQ(help.status, 0) << help.err;
  return Json::parse(help.out);
}

TEST(HelpInJson, HasTheWordsOfEveryCommand) {
  const Json tool = described({});
  for (const Section& section : sections()) {
    if (!kReadsTraces && !section.command.empty() && section.command.front() == "trace") continue;
    SCOPED_TRACE(::testing::PrintToString(section.command));
    Json command = tool;
    for (const std::string& word : section.command)
      command = Json(named(command["commands"], word));
    ASSERT_FALSE(command.empty());
    if (section.command.size() == 1) {
      EXPECT_EQ(command, described(section.command));
    }
    EXPECT_EQ(command["description"], section.phrases.at(0));
    std::vector<std::string> texts;
    for (const Json& option : command["options"]) {
      const std::string value = option["value"].is_null() ? "" : ' ' + std::string(option["value"]);
      texts.push_back(std::string(option["names"].back()) + value + ' ' +
                      std::string(option["description"]));
      EXPECT_EQ(option["value"].is_null(), option["kind"].is_null());
    }
    for (const Json& argument : command["arguments"]) {
      texts.push_back(std::string(argument["name"]) + ' ' + std::string(argument["description"]));
    }
    for (size_t i = 1; i < section.phrases.size(); ++i) {
      EXPECT_THAT(texts, ::testing::Contains(section.phrases[i]));
    }
  }
}

TEST(HelpInJson, SaysWhatArgumentsAndValuesAre) {
  const auto kinds = [](const Arguments& command) {
    std::vector<std::string> found;
    const Json help = described(command);
    for (const Json& argument : help["arguments"]) found.push_back(argument["kind"]);
    return found;
  };
  using ::testing::ElementsAre;
  EXPECT_THAT(kinds({"services", "add"}), ElementsAre("text", "text"));
  EXPECT_THAT(kinds({"services", "port"}), ElementsAre("service"));
  EXPECT_THAT(kinds({"file", "copy"}), ElementsAre("file", "file"));
  EXPECT_THAT(kinds({"dir", "delete"}), ElementsAre("directory"));
  EXPECT_THAT(kinds({"space"}), ElementsAre("text", "file"));
  EXPECT_THAT(kinds({"user", "home"}), ElementsAre("user"));
  EXPECT_THAT(kinds({"group", "has"}), ElementsAre("group", "user"));
  EXPECT_THAT(kinds({"inittab", "add"}), ElementsAre("text", "text", "choice", "text"));
  EXPECT_THAT(kinds({"help"}), ElementsAre("command"));

  const Json creation = described({"file", "create"});
  EXPECT_EQ(named(creation["options"], "--owner")["kind"], "user");
  EXPECT_EQ(named(creation["options"], "--group")["kind"], "group");
  EXPECT_EQ(named(creation["options"], "--trace")["kind"], "directory");
  EXPECT_EQ(named(creation["options"], "--force")["kind"], nullptr);

  const Json screening = described({"screen"});
  EXPECT_EQ(screening["arguments"][0]["required"], true);
  EXPECT_EQ(screening["arguments"][0]["repeated"], true);
  const Json search = described({"services", "free-port"});
  EXPECT_EQ(search["arguments"][0]["required"], false);
  EXPECT_EQ(search["arguments"][0]["repeated"], false);
}

TEST(HelpInJson, HasAnEmptyListOfTheCommandsOfACommand) {
  EXPECT_EQ(described({"file", "copy"}).value("commands", Json()), Json::array());
}

TEST(HelpInJson, SaysWhetherOptionsMayFollowArguments) {
  EXPECT_EQ(described({})["options_among_arguments"], false);
  EXPECT_EQ(described({"file", "copy"})["options_among_arguments"], false);
  if (!kReadsTraces) GTEST_SKIP() << "the tool has no trace commands";
  const Json family = described({"trace"});
  EXPECT_EQ(family["options_among_arguments"], false);
  EXPECT_EQ(family["commands"].size(), 4U);
  for (const Json& command : family["commands"]) {
    EXPECT_EQ(command["options_among_arguments"], true) << command["name"];
  }
}

// The choices are those that the command accepts.
TEST(HelpInJson, NamesJustTheChoicesOfAnArgument) {
  const TempDir temp;
  const std::string inittab = temp.file("inittab", "");
  const auto add = [&](const std::string& action) {
    return osutils({"inittab", "add", "--dry-run", "--file", inittab, "a", "2", action, "x"})
        .status;
  };
  const Json choices = described({"inittab", "add"})["arguments"][2]["choices"];
  EXPECT_EQ(choices.size(), 15U);
  for (const std::string choice : choices) EXPECT_EQ(add(choice), 0) << choice;
  EXPECT_NE(add("another"), 0);
}

TEST(HelpInJson, NamesJustTheChoicesOfAnOption) {
  if (!kReadsTraces) GTEST_SKIP() << "the tool has no trace commands";
  const TempDir temp;
  size_t checked = 0;
  for (const char* name : {"summary", "export"}) {
    const Json help = described({"trace", name});
    for (const Json& option : help["options"]) {
      if (option["kind"] != "choice") continue;
      const auto run = [&](const std::string& choice) {
        return osutils({"trace", name, option["names"].back(), choice, temp.path()}).status;
      };
      EXPECT_FALSE(option["choices"].empty());
      for (const std::string choice : option["choices"]) {
        EXPECT_EQ(run(choice), 3) << choice;  // the folder has no trace
        // The help names them all.
        EXPECT_THAT(std::string(option["description"]), HasSubstr(choice));
      }
      EXPECT_EQ(run("another"), 2);
      ++checked;
    }
  }
  EXPECT_EQ(checked, 3U);
}

TEST(Help, SaysWhereOptionsStandAndWhatTheExitStatusMeans) {
  for (const Arguments& command : {Arguments{}, Arguments{"file"}}) {
    EXPECT_THAT(
        helpOf(command),
        HasSubstr("Options come before a command's other arguments. All words from the "
                  "first such argument on, or after --, are taken literally; but options of the "
                  "trace commands may also follow their paths. The exit "
                  "status is 0 after success and for yes, 1 for no, 2 for wrong usage and 3 "
                  "after a failure. For 2 and 3, one line on standard error gives the "
                  "reason."));
  }
  EXPECT_THAT(helpOf({"file", "stat"}),
              HasSubstr("The exit status is 0 after success, 2 for wrong usage and 3 after a "
                        "failure."));
  EXPECT_THAT(helpOf({"trace", "tree"}),
              HasSubstr("Options may also follow the arguments. The exit status is 0"));
  EXPECT_THAT(helpOf({"screen"}), HasSubstr("The exit status is 0 for yes, 1 for no, 2 for wrong "
                                            "usage and 3 after a failure."));
}

}  // namespace
