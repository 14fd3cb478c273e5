// The words of the help texts. CLI11 arranges them differently in each of its versions.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fstream>
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

TEST(Help, SaysWhereOptionsStandAndWhatTheExitStatusMeans) {
  for (const Arguments& command : {Arguments{}, Arguments{"file"}}) {
    EXPECT_THAT(
        helpOf(command),
        HasSubstr("Options come before a command's other arguments. All words from the "
                  "first such argument on, or after --, are taken literally. The exit "
                  "status is 0 after success and for yes, 1 for no, 2 for wrong usage and 3 "
                  "after a failure. For 2 and 3, one line on standard error gives the "
                  "reason."));
  }
  EXPECT_THAT(helpOf({"file", "stat"}),
              HasSubstr("The exit status is 0 after success, 2 for wrong usage and 3 after a "
                        "failure."));
  EXPECT_THAT(helpOf({"screen"}), HasSubstr("The exit status is 0 for yes, 1 for no, 2 for wrong "
                                            "usage and 3 after a failure."));
}

}  // namespace
