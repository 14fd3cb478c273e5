// trace summary: what each function, thread or process did.
#include "summary.h"

#include <algorithm>
#include <bit>

#include "view.h"

namespace traces {
namespace {

// Counts of durations, in classes whose width is less than 1 % of their values.
class Histogram {
 public:
  void add(int64_t value) {
    const uint16_t index = classOf(static_cast<uint64_t>(std::max<int64_t>(value, 0)));
    auto place = std::ranges::lower_bound(counts_, index, {}, &Count::index);
    if (place == counts_.end() || place->index != index) place = counts_.insert(place, {index, 0});
    ++place->number;
  }

  // The middle of the class that has the value of this rank, counted from 1.
  int64_t valueAt(uint64_t rank) const {
    uint64_t seen = 0;
    for (const Count& count : counts_) {
      seen += count.number;
      if (seen >= rank) return middleOf(count.index);
    }
    return 0;
  }

 private:
  // Each power of two from 2^kBits on has that number of classes; smaller values have one each.
  static constexpr unsigned kBits = 7;

  struct Count {
    uint16_t index;
    uint64_t number;
  };

  static uint16_t classOf(uint64_t value) {
    const unsigned power = static_cast<unsigned>(std::bit_width(value));
    const unsigned shift = power > kBits + 1 ? power - (kBits + 1) : 0;
    return static_cast<uint16_t>((shift << kBits) + (value >> shift));
  }
  static int64_t middleOf(uint16_t index) {
    const unsigned shift = index < (1U << kBits) ? 0 : (index >> kBits) - 1U;
    const uint64_t least = (static_cast<uint64_t>(index) - (static_cast<uint64_t>(shift) << kBits))
                           << shift;
    return static_cast<int64_t>(least + ((uint64_t{1} << shift) >> 1));
  }

  std::vector<Count> counts_;  // sorted
};

struct Row {
  const Function* function = nullptr;
  const Thread* thread = nullptr;
  uint64_t calls = 0;
  uint64_t unfinished = 0;
  uint64_t unknown = 0;  // whether they failed
  uint64_t timed = 0;
  int64_t total = 0;
  int64_t own = 0;
  int64_t shortest = 0;
  int64_t longest = 0;
  int64_t longest_at = 0;
  uint64_t failed = 0;
  std::map<int64_t, uint64_t> failures;
  Histogram times;

  int64_t mean() const { return total / static_cast<int64_t>(timed); }
  // The least time that at least this part of the calls did not exceed.
  int64_t percentile(uint64_t percent) const {
    return std::clamp(times.valueAt((timed * percent + 99) / 100), shortest, longest);
  }
};

enum class By { kFunction, kThread, kProcess };

class Summary : public Visitor {
 public:
  explicit Summary(By by) : by_(by) {}

  void end(const Call& call) override {
    Row& row = rowOf(call);
    ++row.calls;
    if (!call.has_exit) {
      ++row.unfinished;
      return;
    }
    if (call.failed == Failed::kUnknown) {
      ++row.unknown;
    } else if (call.failed == Failed::kYes) {
      ++row.failed;
      ++row.failures[*call.code];
    }
    if (!call.has_entry) return;
    const int64_t total = call.total();
    row.total += total;
    row.own += call.own();
    row.times.add(total);
    if (row.timed == 0 || total < row.shortest) row.shortest = total;
    if (row.timed == 0 || total > row.longest) {
      row.longest = total;
      row.longest_at = call.begin;
    }
    ++row.timed;
  }

  std::vector<const Row*> rows() const {
    std::vector<const Row*> list;
    for (const auto& [key, row] : rows_) list.push_back(&row);
    return list;
  }

 private:
  using Key = std::pair<const void*, uint64_t>;

  Row& rowOf(const Call& call) {
    const Key key = by_ == By::kFunction  ? Key(call.function, 0)
                    : by_ == By::kProcess ? Key(call.thread->process, 0)
                                          : Key(call.thread->process, call.thread->id);
    if (last_ == nullptr || key != last_key_) {
      last_ = &rows_[key];
      last_key_ = key;
      last_->function = call.function;
      last_->thread = call.thread;
    }
    return *last_;
  }

  const By by_;
  std::map<Key, Row> rows_;
  Key last_key_;
  Row* last_ = nullptr;
};

By byOf(const Options& options) {
  const std::string by = options.by.value_or("function");
  if (by == "function") return By::kFunction;
  if (by == "thread") return By::kThread;
  if (by == "process") return By::kProcess;
  throw Usage("--by is not process, thread or function: " + inQuotes(by));
}

// What the row is about.
Answer subjectOf(const Row& row, By by) {
  if (by == By::kFunction) return {{"function", row.function->name}};
  const Process& process = *row.thread->process;
  Answer subject = {{"host", process.host}, {"program", process.program}, {"pid", process.id}};
  if (by == By::kThread) subject["tid"] = row.thread->id;
  return subject;
}

using Less = bool (*)(const Row&, const Row&);

// Puts the largest first.
template <auto member>
bool isLarger(const Row& a, const Row& b) {
  return a.*member > b.*member;
}
template <uint64_t percent>
bool hasLargerPercentile(const Row& a, const Row& b) {
  return (a.timed > 0 ? a.percentile(percent) : -1) > (b.timed > 0 ? b.percentile(percent) : -1);
}
bool hasLargerMean(const Row& a, const Row& b) {
  return (a.timed > 0 ? a.mean() : -1) > (b.timed > 0 ? b.mean() : -1);
}

Less orderOf(const Options& options, By by) {
  const std::map<std::string, Less> orders = {
      {"total", isLarger<&Row::total>}, {"own", isLarger<&Row::own>},
      {"mean", hasLargerMean},          {"median", hasLargerPercentile<50>},
      {"p99", hasLargerPercentile<99>}, {"longest", isLarger<&Row::longest>},
      {"calls", isLarger<&Row::calls>}, {"failures", isLarger<&Row::failed>}};
  const std::string key = options.sort.value_or("total");
  if (key == "function" && by == By::kFunction) {
    return [](const Row& a, const Row& b) { return a.function->name < b.function->name; };
  }
  const auto order = orders.find(key);
  if (order == orders.end()) throw Usage("--sort is not a key of this summary: " + inQuotes(key));
  return order->second;
}

Answer jsonRow(const Row& row, By by) {
  Answer failures = Answer::object();
  for (const auto& [code, number] : row.failures) failures[std::to_string(code)] = number;
  Answer line = subjectOf(row, by);
  line["calls"] = row.calls;
  line["unfinished"] = row.unfinished;
  line["failures"] = failures;
  line["unknown"] = row.unknown;
  line["total"] = row.total;
  line["own"] = row.own;
  const bool is_timed = row.timed > 0;
  line["mean"] = is_timed ? Answer(row.mean()) : Answer();
  line["median"] = is_timed ? Answer(row.percentile(50)) : Answer();
  line["p99"] = is_timed ? Answer(row.percentile(99)) : Answer();
  line["longest"] = is_timed ? Answer(row.longest) : Answer();
  line["longest_at"] = is_timed ? Answer(row.longest_at) : Answer();
  return line;
}

Answer textRow(const Row& row, By by) {
  std::string failures;
  for (const auto& [code, number] : row.failures) {
    failures += (failures.empty() ? "" : " ") + std::to_string(code) + ":" + std::to_string(number);
  }
  const auto duration = [&row](int64_t value) {
    return row.timed > 0 ? durationText(value) : std::string("-");
  };
  Answer line = subjectOf(row, by);
  line["calls"] = row.calls;
  line["unfinished"] = row.unfinished;
  line["unknown"] = row.unknown;
  line["failures"] = failures.empty() ? "-" : failures;
  line["total"] = duration(row.total);
  line["own"] = duration(row.own);
  line["mean"] = row.timed > 0 ? durationText(row.mean()) : "-";
  line["median"] = duration(row.percentile(50));
  line["p99"] = duration(row.percentile(99));
  line["longest"] = duration(row.longest);
  line["longest_at"] = row.timed > 0 ? timeText(row.longest_at) : "-";
  return line;
}

class FunctionRows : public FunctionSummary {
 public:
  void end(const Call& call) override { summary_.end(call); }
  Answer rows() const override {
    Answer rows = Answer::array();
    for (const Row* const row : summary_.rows()) rows.push_back(jsonRow(*row, By::kFunction));
    return rows;
  }

 private:
  Summary summary_{By::kFunction};
};

}  // namespace

std::unique_ptr<FunctionSummary> makeFunctionSummary() { return std::make_unique<FunctionRows>(); }

Answer summarize(Tool& tool, Options& options) {
  const By by = byOf(options);
  const Less order = orderOf(options, by);
  Summary summary(by);
  const Reading reading = readCalls(tool, options, summary);
  std::vector<const Row*> rows = summary.rows();
  if (options.errors) std::erase_if(rows, [](const Row* row) { return row->failed == 0; });
  std::vector<std::pair<Answer, const Row*>> sorted;
  sorted.reserve(rows.size());
  for (const Row* const row : rows) sorted.emplace_back(subjectOf(*row, by), row);
  std::sort(sorted.begin(), sorted.end(), [order](const auto& a, const auto& b) {
    if (order(*a.second, *b.second)) return true;
    return !order(*b.second, *a.second) && a.first < b.first;
  });

  Answer list = Answer::array();
  for (const auto& [subject, row] : sorted) {
    list.push_back(tool.printsJson() ? jsonRow(*row, by) : textRow(*row, by));
  }
  if (!tool.printsJson()) return list;
  const char* const subjects = by == By::kFunction ? "functions"
                               : by == By::kThread ? "threads"
                                                   : "processes";
  return {{subjects, list},
          {"traces", reading.traces},
          {"records", reading.records},
          {"discarded", reading.discarded},
          {"foreign", reading.foreign},
          {"unreadable", reading.unreadable}};
}

}  // namespace traces
