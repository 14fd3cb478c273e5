// The differences that `restore --dry-run` shows: each is applied to the first text by a reader of its
// own, and compared with the longest common subsequence.
#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "tool.h"
#include "world.h"

namespace {

using Lines = std::vector<std::string>;

constexpr size_t kContext = 3;

// Lines include their newline; the last one may have none.
Lines linesOf(const std::string& text) {
  Lines lines;
  for (size_t at = 0; at < text.size();) {
    const size_t end = std::min(text.find('\n', at), text.size() - 1) + 1;
    lines.push_back(text.substr(at, end - at));
    at = end;
  }
  return lines;
}

// The least number of lines to remove and to add.
size_t leastChanges(const Lines& before, const Lines& after) {
  std::vector<size_t> row(after.size() + 1, 0);
  for (const std::string& line : before) {
    size_t diagonal = 0;
    for (size_t j = 0; j < after.size(); ++j) {
      const size_t above = row[j + 1];
      row[j + 1] = line == after[j] ? diagonal + 1 : std::max(above, row[j]);
      diagonal = above;
    }
  }
  return before.size() + after.size() - 2 * row.back();
}

struct Difference {
  std::string result;  // of applying it
  size_t changes = 0;  // lines that are removed or added
  size_t hunks = 0;
};

// Applies the hunks, after the two lines with the names. A failure if one does not fit, or has not its
// three lines of context, or could share its context with the one before.
class Applied {
 public:
  Applied(const Lines& before, const std::string& shown) : before_(before), shown_(shown) {}

  Difference difference() {
    for (std::string line; std::getline(shown_, line);) hunk(line);
    copyTo(before_.size());
    return difference_;
  }

 private:
  void hunk(const std::string& header) {
    ++difference_.hunks;
    size_t from = 0;
    size_t removed_and_kept = 1;
    size_t to = 0;
    size_t added_and_kept = 1;
    readHeader(header, from, removed_and_kept, to, added_and_kept);
    const size_t begin = removed_and_kept == 0 ? from : from - 1;
    const size_t left_before = at_;
    ASSERT_GE(begin, at_) << header;
    copyTo(begin);
    EXPECT_EQ(written_, added_and_kept == 0 ? to : to - 1) << header;
    std::string kinds;
    for (size_t done_before = 0, done_after = 0;
         done_before < removed_and_kept || done_after < added_and_kept;) {
      std::string line;
      ASSERT_TRUE(std::getline(shown_, line)) << header;
      ASSERT_FALSE(line.empty());
      const char kind = line[0];
      line.erase(0, 1);
      kinds += kind;
      const bool is_last = shown_.peek() == '\\';
      if (is_last) {
        std::string mark;
        std::getline(shown_, mark);
        EXPECT_EQ(mark, "\\ No newline at end of file");
      } else {
        line += '\n';
      }
      if (kind != '+') {
        ++done_before;
        ASSERT_LT(at_, before_.size());
        EXPECT_EQ(line, before_[at_++]);
      }
      if (kind != '-') {
        ++done_after;
        ++written_;
        difference_.result += line;
      }
      if (kind != ' ') ++difference_.changes;
    }
    const size_t first = kinds.find_first_not_of(' ');
    ASSERT_NE(first, std::string::npos) << "no change in " << header;
    const size_t last = kinds.size() - 1 - kinds.find_last_not_of(' ');
    EXPECT_EQ(first, std::min(kContext, begin - left_before + first)) << header;
    EXPECT_EQ(last, std::min(kContext, before_.size() - at_ + last)) << header;
    EXPECT_EQ(kinds.find(std::string(2 * kContext + 1, ' ')), std::string::npos) << header;
    EXPECT_TRUE(difference_.hunks == 1 || begin > left_before) << "could be one: " << header;
  }

  static void readHeader(const std::string& header, size_t& from, size_t& removed_and_kept,
                         size_t& to, size_t& added_and_kept) {
    std::istringstream parts(header);
    std::string at;
    char sign = 0;
    parts >> at >> sign >> from;
    EXPECT_EQ(at, "@@");
    EXPECT_EQ(sign, '-');
    if (parts.peek() == ',') {
      parts.get();
      parts >> removed_and_kept;
      EXPECT_NE(removed_and_kept, 1U) << header;
    }
    parts >> sign >> to;
    EXPECT_EQ(sign, '+');
    if (parts.peek() == ',') {
      parts.get();
      parts >> added_and_kept;
      EXPECT_NE(added_and_kept, 1U) << header;
    }
    std::string rest;
    std::getline(parts, rest);
    EXPECT_EQ(rest, " @@");
  }

  void copyTo(size_t end) {
    for (; at_ < end; ++at_, ++written_) difference_.result += before_.at(at_);
  }

  const Lines& before_;
  std::istringstream shown_;
  Difference difference_;
  size_t at_ = 0;
  size_t written_ = 0;
};

class Differences : public ::testing::Test {
 protected:
  // Shows the difference and applies it.
  Difference between(const std::string& before, const std::string& after) const {
    writeFile(file, before);
    writeFile(backup, after);
    const Result shown = osutils({"services", "restore", "--dry-run", "--force", "--file", file});
    EXPECT_EQ(shown.status, 0) << shown.err;
    const std::string names = "--- " + file + "\n+++ " + backup + "\n";
    EXPECT_EQ(shown.out.substr(0, names.size()), names);
    Difference found =
        Applied(linesOf(before), shown.out.substr(std::min(names.size(), shown.out.size())))
            .difference();
    EXPECT_TRUE(found.result == after) << shown.out;
    return found;
  }

  const TempDir temp;
  const std::string file = temp.path("file");
  const std::string backup = file + ".vrasave";
};

TEST_F(Differences, OfRandomTextsAreShortestAndCanBeApplied) {
  std::mt19937 random(1);
  const auto pick = [&](size_t below) { return random() % below; };
  for (int number = 0; number < 250; ++number) {
    SCOPED_TRACE(number);
    const size_t words = 1 + pick(30);
    std::string before;
    std::string after;
    const size_t lines = pick(40);
    const size_t steadiness = 1 + pick(12);
    const auto word = [&] { return std::string(1, static_cast<char>('A' + pick(words))) + "\n"; };
    for (size_t i = 0; i < lines; ++i) {
      const std::string line = word();
      const size_t change = pick(steadiness);
      if (change != 0 || pick(2) == 0) before += line;
      if (change != 0) after += line;
      if (change == 0 && pick(2) == 0) after += word();
    }
    if (pick(4) == 0) before += "end";
    if (pick(4) == 0) after += pick(2) == 0 ? "end" : "another end";
    if (before == after) continue;
    EXPECT_EQ(between(before, after).changes, leastChanges(linesOf(before), linesOf(after)))
        << before << "->\n"
        << after;
  }
}

TEST_F(Differences, HaveTheFormOfDiff) {
  writeFile(file, "a\nb\nc\nd\ne\n");
  writeFile(backup, "a\nb\nc\nX\nd\ne");
  const Result shown = osutils({"services", "restore", "--dry-run", "--file", file});
  EXPECT_EQ(shown.out, "--- " + file + "\n+++ " + backup +
                           "\n@@ -1,5 +1,6 @@\n a\n b\n c\n+X\n d\n-e\n+e\n"
                           "\\ No newline at end of file\n");
  writeFile(file, "");
  writeFile(backup, "a\n");
  EXPECT_EQ(osutils({"services", "restore", "--dry-run", "--file", file}).out,
            "--- " + file + "\n+++ " + backup + "\n@@ -0,0 +1 @@\n+a\n");
}

// Changes that are six lines apart share a hunk; those that are seven apart do not.
TEST_F(Differences, ShareAHunkWhereTheirContextMeets) {
  for (const size_t apart : {1U, 5U, 6U, 7U, 8U}) {
    std::string before = "0\nx\n";
    std::string after = "0\ny\n";
    for (size_t i = 0; i < apart; ++i) {
      before += std::to_string(i + 1) + "\n";
      after += std::to_string(i + 1) + "\n";
    }
    before += "x\n9\n";
    after += "y\n9\n";
    EXPECT_EQ(between(before, after).hunks, apart <= 6 ? 1U : 2U) << apart;
  }
}

// With more changes than a thousand, every line after the first change is shown as changed.
TEST_F(Differences, AreSearchedForUpToAThousandChanges) {
  std::string before = "first\n";
  std::string after = "first\n";
  for (int i = 0; i < 500; ++i) {
    const std::string number = std::to_string(i) + "\n";
    before += "old " + number + "same " + number;
    after += "new " + number + "same " + number;
  }
  EXPECT_EQ(between(before, after).changes, 1000U);
  EXPECT_EQ(between(before, after + "last\n").changes, 2001U);
}

}  // namespace
