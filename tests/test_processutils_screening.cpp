#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "test_processutils.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;

namespace {

// A program that a shell ran: its name and its arguments.
using Words = std::vector<std::string>;

constexpr std::string_view kBlanks = " \t";

// Splits a text without metacharacters as a shell does: into words between blanks and tabs. A word
// that begins with "#" starts a comment.
struct Literal {
  Words words;
  bool ends_the_line = false;
};
Literal literal(std::string_view text) {
  Literal result;
  while (true) {
    const size_t begin = text.find_first_not_of(kBlanks);
    if (begin == text.npos) return result;
    text.remove_prefix(begin);
    if (text.front() == '#') {
      result.ends_the_line = true;
      return result;
    }
    const size_t length = std::min(text.find_first_of(kBlanks), text.size());
    result.words.emplace_back(text.substr(0, length));
    text.remove_prefix(length);
  }
}

// Texts of up to 12 pieces, most of which have a meaning in some shell.
class RandomTexts {
 public:
  std::string next() {
    static constexpr std::string_view kPieces[] = {" ",        "  ",
                                                   "\t",       "#",
                                                   "!",        "%",
                                                   "+",        ",",
                                                   "-",        ".",
                                                   "/",        ":",
                                                   "=",        "@",
                                                   "_",        "a",
                                                   "Z",        "0",
                                                   "1",        "2",
                                                   "if",       "then",
                                                   "fi",       "do",
                                                   "done",     "while",
                                                   "case",     "esac",
                                                   "exec",     "eval",
                                                   "!!",       "!1",
                                                   "..",       "./",
                                                   "/etc",     "//",
                                                   "--",       "-r",
                                                   "-f",       "%1",
                                                   "A=b",      "PATH=",
                                                   "+=",       "x=1 y",
                                                   "inst1",    "vraslapd",
                                                   "\x01",     "\x02",
                                                   "\x07",     "\x08",
                                                   "\x0b",     "\x0c",
                                                   "\x1b",     "\x1f",
                                                   "\x7f",     "\x80",
                                                   "\x81",     "\x82",
                                                   "\x88",     "\xa0",
                                                   "\xc2\xa0", "\xe2\x80\x83",
                                                   "\xff"};
    std::string text;
    for (size_t pieces = below(13); pieces > 0; --pieces) {
      switch (below(20)) {
        case 0:
          text += static_cast<char>(1 + below(255));
          break;
        case 1:
          if (below(4) == 0) text += kMetaCharacters[below(kMetaCharacters.size())];
          break;
        default:
          text += kPieces[below(std::size(kPieces))];
      }
    }
    return text;
  }

 private:
  size_t below(size_t bound) { return random_() % bound; }

  std::mt19937 random_{20061116};
};

bool isClean(std::string text) { return !checkForMetaChars(text.data()); }

// Runs the commands in a real shell. Returns for each the programs that it ran, sorted, and the
// number of commands of any kind. In that shell, `programs` are functions that log their arguments,
// and no other program is found.
struct ShellRun {
  std::vector<Words> programs;
  int commands = 0;
};
std::vector<ShellRun> runInShell(const std::vector<std::string>& commands,
                                 const std::vector<std::string>& programs) {
  const TempDir temp;
  const std::string empty = temp.dir("empty");
  const std::string log = temp.file("log", "");
  const std::string mark = "-one-command-";

  // The trace on standard error has one mark for each command, without those inside the functions.
  // Each function makes one write, which is short enough to be atomic.
  std::string script = "PATH=" + empty + "\nPS4='" + mark + "'\ncd " + empty + "\n";
  for (const std::string& name : programs) {
    script += name + "() { printf '%s\\0' \"$osu_case\" \"$#\" " + name + " \"$@\" >> " + log +
              "; } 2> /dev/null\n";
  }
  script += "set -x\n";
  for (size_t i = 0; i < commands.size(); ++i) {
    script += "osu_case=" + std::to_string(i) + "\n" + commands[i] + "\n";
  }
  script += "osu_case=end\n";
  const std::string file = temp.file("script", script);
  const std::string trace = temp.path("trace");
  EXPECT_EQ(system(("/bin/sh " + file + " 2> " + trace + " < /dev/null").c_str()) % 256, 0);

  std::vector<ShellRun> runs(commands.size());
  const std::string traced = contentsOf(trace);
  size_t current = 0;
  bool ended = false;
  for (size_t at = traced.find(mark); at != traced.npos; at = traced.find(mark, at)) {
    at += mark.size();
    constexpr std::string_view kCase = "osu_case=";
    if (traced.compare(at, kCase.size(), kCase) != 0) {
      if (current < runs.size()) ++runs[current].commands;
      continue;
    }
    const std::string number = traced.substr(at + kCase.size(), traced.find('\n', at) - at - 9);
    ended = number == "end";
    if (!ended) current = std::stoul(number);
  }
  EXPECT_TRUE(ended) << "the shell gave up after command " << current << ": " << commands[current];

  const std::string logged = contentsOf(log);
  size_t at = 0;
  const auto field = [&] {
    const size_t end = std::min(logged.find('\0', at), logged.size());
    const std::string text = logged.substr(at, end - at);
    at = end + 1;
    return text;
  };
  while (at < logged.size()) {
    const size_t index = std::stoul(field());
    const size_t arguments = std::stoul(field());
    Words words = {field()};
    for (size_t i = 0; i < arguments; ++i) words.push_back(field());
    runs.at(index).programs.push_back(words);
  }
  for (ShellRun& run : runs) std::sort(run.programs.begin(), run.programs.end());
  return runs;
}

std::string printable(const std::string& text) { return testing::PrintToString(text); }

TEST(Screening, LeavesOnlyWordsForTheLauncher) {
  constexpr size_t kTexts = 6000;
  RandomTexts texts;
  std::vector<std::string> accepted;
  const FakeSystem system;
  size_t refused = 0;
  while (accepted.size() < kTexts) {
    const std::string text = texts.next();
    // The directory is not screened: here it inserts a program before the launcher's name.
    const int rc = startProcess("launch ", text.c_str());
    ASSERT_EQ(rc, isClean(text) ? 0 : 89) << printable(text);
    if (rc == 0) {
      accepted.push_back(text);
    } else {
      ++refused;
    }
  }
  EXPECT_GT(refused, kTexts / 50);
  std::vector<std::string> commands;
  for (const auto& command : system.commands()) commands.push_back(command.value());
  ASSERT_EQ(commands.size(), kTexts);

  const std::vector<ShellRun> runs = runInShell(commands, {"launch"});

  for (size_t i = 0; i < kTexts; ++i) {
    Words words = {"launch", "/vrarun"};
    for (const std::string& word : literal(accepted[i]).words) words.push_back(word);
    ASSERT_THAT(runs[i].programs, ElementsAre(words)) << printable(accepted[i]);
    ASSERT_EQ(runs[i].commands, 1) << printable(accepted[i]);
  }
}

// Returns the programs that the pipeline of isProcessStarted runs for these texts.
std::vector<Words> pipelineOf(const std::string& pid, const std::string& name) {
  std::vector<Words> programs = {{"ps", "-e", "-o", "pid", "-o", "comm"}};
  const auto add = [&](Words first, const Literal& rest) {
    first.insert(first.end(), rest.words.begin(), rest.words.end());
    programs.push_back(first);
    return !rest.ends_the_line;
  };
  // The bracket expression is part of the last word of the id, or a separate word.
  Literal id = literal(pid + "[]");
  if (!id.ends_the_line) id.words.back().insert(id.words.back().size() - 1, " ");
  if (add({"grep"}, id) && add({"grep"}, literal(name))) {
    programs.push_back({"grep", "-v", "<defunct>"});
  }
  std::sort(programs.begin(), programs.end());
  return programs;
}

TEST(Screening, LeavesOnlyWordsForPsAndGrep) {
  constexpr size_t kPairs = 1500;
  RandomTexts texts;
  std::vector<std::pair<std::string, std::string>> accepted;
  const FakeSystem system;
  size_t refused = 0;
  while (accepted.size() < kPairs) {
    const std::string pid = texts.next();
    const std::string name = texts.next();
    const bool answer = isProcessStarted(pid.c_str(), name.c_str());
    ASSERT_EQ(answer, isClean(pid) && isClean(name)) << printable(pid) << printable(name);
    if (answer) {
      accepted.emplace_back(pid, name);
    } else {
      ++refused;
    }
  }
  EXPECT_GT(refused, kPairs / 50);
  std::vector<std::string> commands;
  for (const auto& command : system.commands()) commands.push_back(command.value());
  ASSERT_EQ(commands.size(), kPairs);

  const std::vector<ShellRun> runs = runInShell(commands, {"ps", "grep"});

  for (size_t i = 0; i < kPairs; ++i) {
    const auto& [pid, name] = accepted[i];
    const std::vector<Words> expected = pipelineOf(pid, name);
    ASSERT_THAT(runs[i].programs, ElementsAreArray(expected)) << printable(pid) << printable(name);
    ASSERT_EQ(runs[i].commands, static_cast<int>(expected.size()))
        << printable(pid) << printable(name);
  }
}

// Shows that the two tests above can fail: with metacharacters, a shell runs something else.
TEST(Screening, IsWhatKeepsTheShellFromObeying) {
  const std::vector<ShellRun> runs =
      runInShell({"launch /vrarun a;other b > /dev/null 2>&1", "launch /vrarun a > /dev/null 2>&1",
                  "launch /vrarun A=$((1+1)) > /dev/null 2>&1"},
                 {"launch"});

  EXPECT_EQ(runs[0].commands, 2);  // one of them without a program
  EXPECT_THAT(runs[0].programs, ElementsAre(Words{"launch", "/vrarun", "a"}));
  EXPECT_EQ(runs[1].commands, 1);
  EXPECT_THAT(runs[2].programs, ElementsAre(Words{"launch", "/vrarun", "A=2"}));
}

}  // namespace
