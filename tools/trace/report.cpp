// trace report: one page with a timeline, the calls and their summary.
#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdio.h>
#include <string.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <fstream>
#include <iterator>
#include <limits>
#include <map>
#include <memory>

#include "page.h"
#include "summary.h"
#include "text.h"
#include "view.h"

namespace traces {
namespace {

// Where Debian's package node-d3 has D3 in one file.
constexpr const char* kD3 = "/usr/share/nodejs/d3/dist/d3.min.js";

// A browser handles a page with this much. What is more is merged, or counted.
constexpr uint64_t kMostCalls = 1'000'000;
constexpr uint64_t kMostMessages = 200'000;
constexpr uint64_t kMostTextBytes = uint64_t{64} << 20;  // of all messages
constexpr size_t kMostBytesOfAText = 4096;

constexpr size_t kChunkBytes = size_t{256} << 10;

// JSON for a script element: nothing in it may end the element.
std::string scriptText(std::string_view json) {
  std::string safe;
  for (const char c : json) {
    if (c == '<') {
      safe += "\\u003c";
    } else {
      safe += c;
    }
  }
  return safe;
}

// The bits of a call's state, as the page reads them.
constexpr unsigned kFailed = 1;
constexpr unsigned kUnknown = 2;
constexpr unsigned kUnfinished = 4;
constexpr unsigned kNoEntry = 8;

unsigned stateOf(const Call& call) {
  unsigned state = call.has_entry ? 0 : kNoEntry;
  if (!call.has_exit) return state | kUnfinished;
  if (call.failed == Failed::kYes) state |= kFailed;
  if (call.failed == Failed::kUnknown) state |= kUnknown;
  return state;
}

// Numbers of calls by their duration, in classes that are a quarter of a power of two.
class Durations {
 public:
  void add(int64_t duration) { ++counts_[classOf(duration)]; }
  uint64_t count() const {
    uint64_t sum = 0;
    for (const uint64_t count : counts_) sum += count;
    return sum;
  }

  // The least duration for which no more calls than these are as long or longer.
  static int64_t leastOf(uint64_t most, const std::vector<const Durations*>& all) {
    uint64_t longer = 0;
    for (size_t i = kClasses; i-- > 0;) {
      for (const Durations* const durations : all) longer += durations->counts_[i];
      if (longer > most) return leastIn(i + 1);
    }
    return 0;
  }

 private:
  static constexpr size_t kClasses = 256;

  static size_t classOf(int64_t duration) {
    const uint64_t value = static_cast<uint64_t>(std::max<int64_t>(duration, 0));
    const size_t shift = std::max<size_t>(static_cast<size_t>(std::bit_width(value)), 3) - 3;
    return 4 * shift + (value >> shift);
  }
  static int64_t leastIn(size_t index) {
    if (index >= size_t{4} * 61) return std::numeric_limits<int64_t>::max();
    const size_t shift = std::max<size_t>(index / 4, 1) - 1;
    return static_cast<int64_t>((index - 4 * shift) << shift);
  }

  std::vector<uint64_t> counts_ = std::vector<uint64_t>(kClasses);
};

// Messages, and what of their texts a page can have.
struct Amount {
  static size_t bytesOf(const Message& message) {
    return std::min(message.text.size(), kMostBytesOfAText);
  }
  void add(const Message& message) {
    ++count;
    bytes += bytesOf(message);
  }

  uint64_t count = 0;
  uint64_t bytes = 0;
};

// The first reading: how much there is.
class Survey : public Visitor {
 public:
  void end(const Call& call) override {
    take(call.begin);
    take(call.end);
    ++calls;
    const bool is_failed = call.failed == Failed::kYes;
    (is_failed ? failed : others).add(call.total());
    unsigned& depth = depths_[call.thread];
    if (call.depth >= depth) {
      lanes += call.depth + 1 - depth;
      depth = call.depth + 1;
    }
    summary->end(call);
  }
  void message(const Message& message) override {
    take(message.time);
    (message.is_error ? errors : ordinary).add(message);
  }
  uint64_t messages() const { return errors.count + ordinary.count; }

  int64_t first = std::numeric_limits<int64_t>::max();
  int64_t last = std::numeric_limits<int64_t>::min();
  uint64_t calls = 0;
  Amount errors;
  Amount ordinary;
  uint64_t lanes = 0;  // of the threads and their depths
  Durations failed;
  Durations others;
  const std::unique_ptr<FunctionSummary> summary = makeFunctionSummary();

 private:
  void take(int64_t time) {
    first = std::min(first, time);
    last = std::max(last, time);
  }

  std::map<const Thread*, unsigned> depths_;
};

// What the page leaves out.
struct Thinning {
  explicit Thinning(const Survey& survey) {
    if (survey.calls > kMostCalls) {
      const uint64_t failed = survey.failed.count();
      if (failed <= kMostCalls / 2) {
        least = Durations::leastOf(kMostCalls - failed, {&survey.others});
      } else {
        least = least_failed = Durations::leastOf(kMostCalls, {&survey.others, &survey.failed});
      }
      widest_gap = (survey.last - survey.first) /
                   static_cast<int64_t>(std::max<uint64_t>(1, kMostCalls / survey.lanes));
    }
    ordinary = survey.ordinary.count;
    most_ordinary.bytes = kMostTextBytes - std::min(survey.errors.bytes, kMostTextBytes);
    most_ordinary.count =
        std::min(ordinary, kMostMessages - std::min(survey.errors.count, kMostMessages));
    if (survey.ordinary.bytes > most_ordinary.bytes) {
      most_ordinary.count =
          std::min(most_ordinary.count, ordinary * most_ordinary.bytes / survey.ordinary.bytes);
    }
  }

  bool isShort(const Call& call) const {
    return call.total() < (call.failed == Failed::kYes ? least_failed : least);
  }

  int64_t least = 0;  // shorter calls are merged
  int64_t least_failed = 0;
  int64_t widest_gap = 0;  // between calls that are merged
  uint64_t ordinary = 0;   // messages
  Amount most_ordinary;    // what errors leave for them
};

// Lists of numbers in script elements, each of limited size.
class Chunks {
 public:
  Chunks(Output& output, const char* name) : output_(output), name_(name) {}

  // Begins a record. Times are the difference to the record before.
  Chunks& operator<<(int64_t number) {
    separate();
    append(text_, number);
    return *this;
  }
  Chunks& time(int64_t time) {
    *this << time - last_time_;
    last_time_ = time;
    return *this;
  }
  Chunks& json(std::string_view text) {
    separate();
    text_ += text;
    return *this;
  }
  void endRecord() {
    if (text_.size() >= kChunkBytes) flush();
  }
  void flush() {
    if (text_.empty()) return;
    output_.add(std::string(R"(<script type="application/json" data-records=")") + name_ + "\">[" +
                text_ + "]</script>\n");
    text_.clear();
    last_time_ = 0;
  }

 private:
  void separate() {
    if (!text_.empty()) text_ += ',';
  }

  Output& output_;
  const char* name_;
  std::string text_;
  int64_t last_time_ = 0;
};

// The second reading: writes the records.
class PageWriter : public Visitor {
 public:
  PageWriter(Output& output, const Thinning& limits, int64_t start)
      : limits_(limits),
        start_(start),
        calls_(output, "calls"),
        merged_(output, "merged"),
        messages_(output, "messages") {}

  void end(const Call& call) override {
    Place& thread = placeOf(*call.thread);
    const size_t lanes = call.depth + size_t{2};
    thread.lanes.resize(std::max(thread.lanes.size(), lanes));
    Group& group = thread.lanes[call.depth];
    Group& inner = thread.lanes[call.depth + size_t{1}];  // of the calls in this one
    const Record record{call.begin - start_, call.total(), indexOf(*call.function), stateOf(call),
                        call.code};
    if (!limits_.isShort(call)) {
      writeGroup(thread, call.depth);
      writeGroup(thread, call.depth + 1);
      writeCall(thread, call.depth, record);
      return;
    }
    if (group.calls > 0 && record.begin - group.end > limits_.widest_gap) {
      writeGroup(thread, call.depth);
    }
    if (group.calls++ == 0) group.first = record;
    group.end = std::max(group.end, record.begin + record.total);
    group.time += record.total;
    group.failed += inner.failed;
    if ((record.state & kFailed) != 0) ++group.failed;
    group.inner += inner.calls + inner.inner;
    inner = Group();
  }

  void message(const Message& message) override {
    if (!keep(message)) {
      ++left_messages;
      return;
    }
    const size_t bytes = Amount::bytesOf(message);
    std::string text = scriptText(jsonText(message.text.substr(0, bytes)));
    if (bytes < message.text.size()) {
      text.insert(text.size() - 1,
                  " … (" + std::to_string(message.text.size() - bytes) + " bytes more)");
    }
    messages_ << static_cast<int64_t>(placeOf(*message.thread).index) << message.depth;
    messages_.time(message.time - start_);
    messages_ << (message.is_error ? 1 : 0) << indexOf(*message.function);
    messages_.json(text).endRecord();
  }

  void finish() {
    for (auto& [thread, place] : threads_) {
      for (unsigned depth = 0; depth < place.lanes.size(); ++depth) writeGroup(place, depth);
    }
    calls_.flush();
    merged_.flush();
    messages_.flush();
  }

  // Lists in the order of the numbers that the records have.
  Answer functions() const { return functions_; }
  Answer threads() const { return thread_list_; }
  Answer processes() const { return process_list_; }

  uint64_t merged_calls = 0;
  uint64_t left_messages = 0;

 private:
  struct Record {
    int64_t begin = 0;
    int64_t total = 0;
    int64_t function = 0;
    unsigned state = 0;
    std::optional<int64_t> code;
  };
  struct Group {
    uint64_t calls = 0;
    uint64_t inner = 0;  // calls in them, which are merged with them
    uint64_t failed = 0;
    int64_t time = 0;  // in the calls: without what is between them
    int64_t end = std::numeric_limits<int64_t>::min();
    Record first;
  };
  struct Place {
    size_t index = 0;
    // At each depth, what is merged of the calls in the one that is open around them.
    std::vector<Group> lanes;
  };

  // Returns whether the page has room for it. Of what is no error it has a part, spread evenly, if not all.
  bool keep(const Message& message) {
    const size_t bytes = Amount::bytesOf(message);
    if (kept_.count == kMostMessages || kept_.bytes + bytes > kMostTextBytes) return false;
    if (!message.is_error) {
      const uint64_t most = limits_.most_ordinary.count;
      const uint64_t before = ordinary_++;
      if (limits_.ordinary > most &&
          before * most / limits_.ordinary == ordinary_ * most / limits_.ordinary) {
        return false;
      }
      if (kept_ordinary_.bytes + bytes > limits_.most_ordinary.bytes) return false;
      kept_ordinary_.add(message);
    }
    kept_.add(message);
    return true;
  }

  void writeCall(const Place& thread, unsigned depth, const Record& record) {
    calls_ << static_cast<int64_t>(thread.index) << depth << record.function;
    calls_.time(record.begin);
    calls_ << record.total << record.state;
    if (!record.code) {
      calls_.json("null");
    } else if (std::abs(static_cast<double>(*record.code)) < 9e15) {
      calls_ << *record.code;
    } else {  // more than a number of the page can hold
      calls_.json('"' + std::to_string(*record.code) + '"');
    }
    calls_.endRecord();
  }

  void writeGroup(Place& thread, unsigned depth) {
    Group& group = thread.lanes[depth];
    const uint64_t calls = group.calls + group.inner;
    if (calls == 1) writeCall(thread, depth, group.first);
    if (calls > 1) {
      merged_ << static_cast<int64_t>(thread.index) << depth;
      merged_.time(group.first.begin);
      merged_ << group.end - group.first.begin << static_cast<int64_t>(group.calls)
              << static_cast<int64_t>(group.failed) << group.time
              << static_cast<int64_t>(group.inner);
      merged_.endRecord();
      merged_calls += calls;
    }
    group = Group();
  }

  int64_t indexOf(const Function& function) {
    while (function_indices_.size() <= function.index) function_indices_.push_back(-1);
    int64_t& index = function_indices_[function.index];
    if (index == -1) {
      index = static_cast<int64_t>(functions_.size());
      functions_.push_back(function.name);
    }
    return index;
  }

  Place& placeOf(const Thread& thread) {
    const auto [place, is_new] = threads_.try_emplace(&thread);
    if (is_new) {
      const auto [process, is_new_process] =
          processes_.try_emplace(thread.process, process_list_.size());
      if (is_new_process) {
        process_list_.push_back(
            {thread.process->host, thread.process->program, thread.process->id});
      }
      place->second.index = thread_list_.size();
      thread_list_.push_back({process->second, thread.id});
    }
    return place->second;
  }

  const Thinning& limits_;
  const int64_t start_;
  Chunks calls_;
  Chunks merged_;
  Chunks messages_;
  Amount kept_;
  Amount kept_ordinary_;
  uint64_t ordinary_ = 0;  // messages so far
  std::vector<int64_t> function_indices_;
  std::map<const Thread*, Place> threads_;
  std::map<const Process*, size_t> processes_;
  Answer functions_ = Answer::array();
  Answer thread_list_ = Answer::array();
  Answer process_list_ = Answer::array();
};

std::string readD3() {
  std::ifstream file(kD3, std::ios::binary);
  std::string text(std::istreambuf_iterator<char>(file), {});
  if (!file || text.empty()) {
    throw Failure(OSUTILS_UNAVAILABLE,
                  std::string("cannot read D3 in ") + kD3 + "; the package node-d3 has it");
  }
  // It must not end the element that it is put into.
  for (const char* const mark : {"</script", "</SCRIPT", "<!--"}) {
    if (text.find(mark) != std::string::npos) {
      throw Failure(OSUTILS_UNWILLING_TO_PERFORM, std::string(kD3) + " contains " + mark);
    }
  }
  return text;
}

// Digits that nobody can foresee, always the same number of them.
std::string randomDigits() {
  std::array<uint64_t, 2> numbers = {};
  if (getrandom(numbers.data(), sizeof numbers, 0) != static_cast<ssize_t>(sizeof numbers)) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, std::string("no random numbers: ") + strerror(errno));
  }
  char text[2 * 16 + 1];
  (void)snprintf(text, sizeof text, "%016" PRIx64 "%016" PRIx64, numbers[0], numbers[1]);
  return text;
}

void requireFree(const std::string& path, bool may_replace) {
  struct stat found;
  if (lstat(path.c_str(), &found) != 0) return;
  if (!may_replace) throw Failure(OSUTILS_ALREADY_EXISTS, path + " exists; --force replaces it");
  if (!S_ISREG(found.st_mode)) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM, path + " is not a regular file");
  }
}

// A new file that gets its name when it is complete. Only the owner may read it, like a trace.
class NewFile {
 public:
  NewFile(std::string path, bool may_replace)
      : path_(std::move(path)),
        may_replace_(may_replace),
        folder_(path_.substr(0, path_.rfind('/') + 1) + '.'),
        temporary_(folder_ + path_.substr(path_.rfind('/') + 1) + '.' + randomDigits()) {
    constexpr mode_t kMode = 0600;
    int descriptor = open(folder_.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, kMode);
    if (descriptor == -1 && (errno == EOPNOTSUPP || errno == EISDIR)) {  // for lack of O_TMPFILE
      descriptor = open(temporary_.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, kMode);
      has_name_ = descriptor != -1;
    }
    if (descriptor == -1) throw failed("make a file beside");
    file_ = fdopen(descriptor, "w");
    if (file_ == nullptr) {
      const int error = errno;
      (void)close(descriptor);
      errno = error;
      throw failed("write to");
    }
  }
  ~NewFile() {
    (void)removeTemporary();
    if (file_ != nullptr) (void)fclose(file_);
  }
  NewFile(const NewFile&) = delete;
  NewFile& operator=(const NewFile&) = delete;

  FILE* file() { return file_; }

  void finish() {
    if (fflush(file_) != 0 || fsync(fileno(file_)) != 0) throw failed("write to");
    if (!giveName()) throw failed("make");
    has_name_ = false;
  }

 private:
  bool removeTemporary() {
    const bool is_removed = !has_name_ || unlink(temporary_.c_str()) == 0;
    has_name_ = false;
    return is_removed;
  }

  bool linkTo(const std::string& name) const {
    const std::string unnamed = "/proc/self/fd/" + std::to_string(fileno(file_));
    return linkat(AT_FDCWD, unnamed.c_str(), AT_FDCWD, name.c_str(), AT_SYMLINK_FOLLOW) == 0;
  }

  // Does not replace a file that was made meanwhile.
  bool giveName() {
    if (!has_name_) {
      if (!may_replace_) return linkTo(path_);
      has_name_ = linkTo(temporary_);  // no call links and replaces
      if (!has_name_) return false;
    }
    const char* const from = temporary_.c_str();
    if (may_replace_) return rename(from, path_.c_str()) == 0;
    if (renameat2(AT_FDCWD, from, AT_FDCWD, path_.c_str(), RENAME_NOREPLACE) == 0) return true;
    // A network file system may know no such flag.
    return errno == EINVAL && link(from, path_.c_str()) == 0 && unlink(from) == 0;
  }

  Failure failed(const char* what) {
    const std::string why = strerror(errno);
    const bool is_removed = removeTemporary();
    return Failure(OSUTILS_OPERATIONS_ERROR, std::string("cannot ") + what + ' ' + path_ + ": " +
                                                 why + (is_removed ? "" : "; left: " + temporary_));
  }

  const std::string path_;
  const bool may_replace_;
  const std::string folder_;
  const std::string temporary_;
  bool has_name_ = false;  // the temporary one
  FILE* file_ = nullptr;
};

// What the page does not show, for its reader. The summary is of the first reading, the timeline of the second.
Answer notesOf(const Reading& first, const Reading& second, const Survey& survey,
               const Thinning& limits, const PageWriter& writer) {
  const Reading& reading = second.unreadable > first.unreadable ? second : first;
  Answer notes = Answer::array();
  if (const std::string loss = lossOf(first, second); !loss.empty()) {
    notes.push_back(loss + ": the summary counts them");
  }
  if (const uint64_t added = second.records - second.again; added > 0) {
    notes.push_back("the trace grew while it was read: the summary lacks the last " +
                    counted(added, "record"));
  }
  for (const std::string& problem : reading.problems) notes.push_back(problem);
  if (reading.unreadable > reading.problems.size()) {
    notes.push_back("and " + std::to_string(reading.unreadable - reading.problems.size()) +
                    " more that could not be read");
  }
  if (reading.discarded > 0) {
    notes.push_back(counted(reading.discarded, "record") + " missing: the tracer discarded them");
  }
  if (reading.foreign > 0) {
    notes.push_back(counted(reading.foreign, "event") + " not of traced functions left out");
  }
  if (writer.merged_calls > 0) {
    notes.push_back(std::to_string(writer.merged_calls) + " of " + counted(survey.calls, "call") +
                    " are merged with their neighbours, with their number and failures, because "
                    "the page would be too large: those shorter than " +
                    durationText(limits.least) +
                    (limits.least_failed > 0 ? "" : " that have not failed") +
                    ". The summary has all calls.");
  }
  if (writer.left_messages > 0) {
    notes.push_back(std::to_string(writer.left_messages) + " of " +
                    counted(survey.messages(), "message") +
                    " left out, because the page would be too large: errors come first.");
  }
  return notes;
}

}  // namespace

Answer reportCalls(Tool& tool, Options& options, bool dry_run) {
  if (!options.output) throw Usage("--output is missing: the file for the report");
  requireFree(*options.output, options.force);
  const std::string d3 = readD3();
  Survey survey;
  const Reading reading = readCalls(tool, options, survey);
  if (survey.calls + survey.messages() == 0 && reading.unreadable > 0) return {};
  Answer answer = {{"report", *options.output},
                   {"calls", survey.calls},
                   {"failed", survey.failed.count()},
                   {"messages", survey.messages()}};
  if (dry_run) return answer;
  if (survey.calls + survey.messages() == 0) survey.first = survey.last = 0;
  const Thinning limits(survey);
  Answer rows = survey.summary->rows();
  // Their nanoseconds since 1970 are more than a number of the page can hold.
  for (Answer& row : rows) {
    if (!row["longest_at"].is_null()) row["longest_at"] = row["longest_at"].dump();
  }

  NewFile file(*options.output, options.force);
  Output output(file.file(), *options.output);
  PageWriter writer(output, limits, survey.first);
  const std::string nonce = randomDigits();  // permits the scripts of the page, and no others
  const std::map<std::string_view, std::function<void()>> parts = {
      {"NONCE", [&] { output.add(nonce); }},
      {"STYLE", [&] { output.add(kReportCss); }},
      {"D3", [&] { output.add(d3); }},
      {"SCRIPT", [&] { output.add(kReportJs); }},
      {"RECORDS", [&] {
         const Reading again = readAgain(tool, options, writer, reading);
         writer.finish();
         const Answer trace = {{"start", std::to_string(survey.first)},
                               {"functions", writer.functions()},
                               {"processes", writer.processes()},
                               {"threads", writer.threads()},
                               {"notes", notesOf(reading, again, survey, limits, writer)},
                               {"summary", rows}};
         output.add(R"(<script type="application/json" id="trace">)" + scriptText(jsonOf(trace)) +
                    "</script>");
       }}};
  for (std::string_view rest = kReportHtml; !rest.empty();) {
    const size_t begin = rest.find('@');
    output.add(rest.substr(0, begin));
    if (begin == std::string_view::npos) break;
    const size_t end = rest.find('@', begin + 1);
    parts.at(rest.substr(begin + 1, end - begin - 1))();
    rest.remove_prefix(end + 1);
  }
  output.write();
  file.finish();
  return answer;
}

}  // namespace traces
