#include "difference.h"

#include <algorithm>
#include <string_view>
#include <vector>

namespace {

// With more changes, the search takes too much memory: all lines are shown as changed.
constexpr int kMaxChanges = 1000;
constexpr size_t kContextLines = 3;

using Lines = std::vector<std::string_view>;

struct DiffLine {
  char kind;  // ' ' both, '-' before only, '+' after only
  std::string_view line;
};

// Lines include their newline; the last one may have none.
Lines linesOf(std::string_view text) {
  Lines lines;
  while (!text.empty()) {
    const size_t length = std::min(text.find('\n'), text.size() - 1) + 1;
    lines.push_back(text.substr(0, length));
    text.remove_prefix(length);
  }
  return lines;
}

void append(std::vector<DiffLine>& script, char kind, const Lines& lines, size_t from, size_t to) {
  for (size_t i = from; i < to; ++i) script.push_back({kind, lines[i]});
}

// Finds the shortest edit script, in reverse order, with Myers' greedy algorithm: for each number
// of changes, the furthest point on each diagonal. Returns false if it needs too many changes.
bool shortestEditScript(const Lines& before, const Lines& after, std::vector<DiffLine>& backwards) {
  const int n = static_cast<int>(before.size());
  const int m = static_cast<int>(after.size());
  const auto same = [&](int x, int y) {
    return before[static_cast<size_t>(x)] == after[static_cast<size_t>(y)];
  };
  std::vector<std::vector<int>> reached;  // [changes][diagonal + changes]
  const auto at = [&](int changes, int diagonal) {
    const int column = diagonal + changes;
    return reached[static_cast<size_t>(changes)][static_cast<size_t>(column)];
  };
  // True if the best path reaches the diagonal by a step down, which inserts a line of `after`.
  const auto isDown = [&](int changes, int diagonal) {
    return diagonal == -changes ||
           (diagonal != changes && at(changes - 1, diagonal - 1) < at(changes - 1, diagonal + 1));
  };
  const auto start = [&](int changes, int diagonal) {
    if (changes == 0) return 0;
    return isDown(changes, diagonal) ? at(changes - 1, diagonal + 1)
                                     : at(changes - 1, diagonal - 1) + 1;
  };

  int changes = 0;
  for (bool arrived = false; !arrived; ++changes) {
    if (changes > kMaxChanges) return false;
    std::vector<int> row;
    for (int diagonal = -changes; diagonal <= changes; ++diagonal) {
      int x = 0;
      if ((diagonal + changes) % 2 == 0) {
        x = start(changes, diagonal);
        while (x < n && x - diagonal < m && x - diagonal >= 0 && same(x, x - diagonal)) ++x;
        arrived = arrived || (diagonal == n - m && x >= n);
      }
      row.push_back(x);
    }
    reached.push_back(std::move(row));
  }

  int x = n;
  int y = m;
  for (--changes; changes >= 0; --changes) {
    const int diagonal = x - y;
    const int from = start(changes, diagonal);
    for (; x > from; --x, --y) backwards.push_back({' ', before[static_cast<size_t>(x - 1)]});
    if (changes == 0) break;
    if (isDown(changes, diagonal)) {
      backwards.push_back({'+', after[static_cast<size_t>(--y)]});
    } else {
      backwards.push_back({'-', before[static_cast<size_t>(--x)]});
    }
  }
  return true;
}

std::vector<DiffLine> editScript(const Lines& before, const Lines& after) {
  const auto [first, second] =
      std::mismatch(before.begin(), before.end(), after.begin(), after.end());
  const Lines before_rest(first, before.end());
  const Lines after_rest(second, after.end());
  std::vector<DiffLine> script;
  append(script, ' ', before, 0, static_cast<size_t>(first - before.begin()));
  std::vector<DiffLine> backwards;
  if (shortestEditScript(before_rest, after_rest, backwards)) {
    script.insert(script.end(), backwards.rbegin(), backwards.rend());
  } else {
    append(script, '-', before_rest, 0, before_rest.size());
    append(script, '+', after_rest, 0, after_rest.size());
  }
  return script;
}

// "3,7" or "3"; for no lines, the number of the line above: "2,0".
std::string range(size_t lines_above, size_t count) {
  const std::string first = std::to_string(count == 0 ? lines_above : lines_above + 1);
  return count == 1 ? first : first + "," + std::to_string(count);
}

}  // namespace

std::string unifiedDiff(const std::string& before_name, const std::string& before,
                        const std::string& after_name, const std::string& after) {
  if (before == after) return "";
  const std::vector<DiffLine> script = editScript(linesOf(before), linesOf(after));
  std::string text = "--- " + before_name + "\n+++ " + after_name + "\n";
  size_t above_before = 0;
  size_t above_after = 0;
  for (size_t i = 0; i < script.size();) {
    // A hunk has three lines of context. Changes whose context meets share a hunk.
    size_t change = i;
    while (change < script.size() && script[change].kind == ' ') ++change;
    if (change == script.size()) break;
    const size_t begin = std::max(i, change - std::min(change, kContextLines));
    above_before += begin - i;
    above_after += begin - i;
    size_t end = change;
    for (size_t j = change; j < script.size() && j <= end + 2 * kContextLines + 1; ++j) {
      if (script[j].kind != ' ') end = j;
    }
    end = std::min(end + 1 + kContextLines, script.size());

    std::string lines;
    size_t in_before = 0;
    size_t in_after = 0;
    for (size_t j = begin; j < end; ++j) {
      in_before += script[j].kind != '+';
      in_after += script[j].kind != '-';
      lines += script[j].kind;
      lines += script[j].line;
      if (!lines.ends_with('\n')) lines += "\n\\ No newline at end of file\n";
    }
    text += "@@ -" + range(above_before, in_before) + " +" + range(above_after, in_after) +
            " @@\n" + lines;
    above_before += in_before;
    above_after += in_after;
    i = end;
  }
  return text;
}
