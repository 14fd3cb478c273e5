// trace tree: the calls of each thread, nested, with their messages.
#include <stdio.h>
#include <unistd.h>

#include "text.h"
#include "view.h"

namespace traces {
namespace {

constexpr size_t kMostPending = 100'000;  // lines that wait for the end of the call around them

constexpr const char* kRed = "\x1b[31m";
constexpr const char* kDim = "\x1b[2m";
constexpr const char* kPlain = "\x1b[0m";

// A line of the tree.
struct Line {
  bool is_message = false;
  bool is_open = false;  // a call that has not ended
  Call call;
  Message message;  // its text is in `text`
  std::string text;
};

// What is not written yet of a thread.
struct Pending {
  struct Open {
    size_t line;              // in `lines`
    bool is_inside;           // the function that is asked for, or called by it
    bool is_written = false;  // before its end
    bool has_kept = false;    // a nested call is kept
  };
  std::vector<Line> lines;
  std::vector<Open> open;
};

bool showsColours() {
  const char* const no_color = getenv("NO_COLOR");
  return isatty(STDOUT_FILENO) == 1 && (no_color == nullptr || no_color[0] == '\0');
}

class Tree : public Visitor {
 public:
  Tree(const Options& options, bool is_json)
      : only_failed_(options.only_failed),
        min_time_(options.min_time ? durationFrom(*options.min_time, "--min-time") : 0),
        function_(options.function),
        is_json_(is_json) {}

  void begin(const Call& call) override {
    Pending& pending = pendingOf(*call.thread);
    pending.open.push_back({pending.lines.size(), isInside(pending, *call.function)});
    Line line;
    line.is_open = true;
    line.call = call;
    addLine(pending, std::move(line));
  }

  void end(const Call& call) override {
    Pending& pending = pendingOf(*call.thread);
    if (!call.has_entry) {
      if (!isWanted(call, isInside(pending, *call.function))) return;
      if (!pending.open.empty()) pending.open.back().has_kept = true;
      Line line;
      line.call = call;
      addLine(pending, std::move(line));
    } else {
      const Pending::Open open = pending.open.back();
      pending.open.pop_back();
      const bool is_kept = open.has_kept || isWanted(call, open.is_inside);
      if (is_kept && !pending.open.empty()) pending.open.back().has_kept = true;
      if (open.is_written) {
        Line line;
        line.call = call;
        addLine(pending, std::move(line));
      } else if (is_kept) {
        pending.lines[open.line].call = call;
        pending.lines[open.line].is_open = false;
      } else {
        pending.lines.resize(open.line);
      }
    }
    writeFinished(pending);
  }

  void message(const Message& message) override {
    Pending& pending = pendingOf(*message.thread);
    if (pending.open.empty() && (only_failed_ || min_time_ > 0 || function_)) return;
    Line line;
    line.is_message = true;
    line.message = message;
    line.text = message.text;
    addLine(pending, std::move(line));
    writeFinished(pending);
  }

  void finish() {
    if (is_json_) output_.add(is_first_ ? "[]\n" : "]\n");
    output_.write();
  }

 private:
  Pending& pendingOf(const Thread& thread) {
    if (&thread != last_thread_) {
      last_thread_ = &thread;
      last_ = &pending_[&thread];
    }
    return *last_;
  }

  bool isInside(const Pending& pending, const Function& function) const {
    return !function_ || function.name == *function_ ||
           (!pending.open.empty() && pending.open.back().is_inside);
  }

  bool isWanted(const Call& call, bool is_inside) const {
    return is_inside && (!only_failed_ || call.failed == Failed::kYes) && call.total() >= min_time_;
  }

  static void addLine(Pending& pending, Line line) { pending.lines.push_back(std::move(line)); }

  void writeFinished(Pending& pending) {
    if (!pending.open.empty() && pending.lines.size() < kMostPending) return;
    write(pending);
    pending.lines.clear();
    if (pending.open.empty()) pending.lines.shrink_to_fit();  // the thread may have ended
    for (Pending::Open& open : pending.open) open.is_written = true;
  }

  void write(const Pending& pending) {
    for (const Line& line : pending.lines) {
      if (is_json_) {
        output_.add((is_first_ ? "[" : ",\n") + jsonOfLine(line));
        is_first_ = false;
      } else {
        writeText(line);
      }
    }
  }

  std::string jsonOfLine(const Line& line) {
    if (!line.is_message) return objects_.of(line.call, line.is_open);
    Message message = line.message;
    message.text = line.text;
    return objects_.of(message);
  }

  void writeText(const Line& line) {
    const Thread& thread = line.is_message ? *line.message.thread : *line.call.thread;
    const int64_t time = line.is_message ? line.message.time : line.call.begin;
    const std::string moment = timeText(time);
    const size_t clock = moment.find('T');
    const std::string date = moment.substr(0, clock);
    if (&thread != shown_thread_ || date != shown_date_) {
      shown_thread_ = &thread;
      shown_date_ = date;
      const Process& process = *thread.process;
      output_.add(printable(process.host + ' ' + process.program) + " process " +
                  std::to_string(process.id) + " thread " + std::to_string(thread.id) + ' ' + date +
                  '\n');
    }
    const unsigned depth = line.is_message ? line.message.depth : line.call.depth;
    std::string text = moment.substr(clock + 1, moment.size() - clock - 2) + "  " +
                       std::string(size_t{2} * depth, ' ');
    text += line.is_message ? textOfMessage(line) : textOfCall(line);
    output_.add(text + '\n');
  }

  std::string coloured(const std::string& text, const char* colour) const {
    return has_colours_ ? colour + text + kPlain : text;
  }

  std::string textOfMessage(const Line& line) const {
    std::string_view text = line.text;
    while (text.ends_with('\n') || text.ends_with(' ')) text.remove_suffix(1);
    return coloured((line.message.is_error ? "! " : "- ") + printable(text),
                    line.message.is_error ? kRed : kDim);
  }

  std::string textOfCall(const Line& line) const {
    const Call& call = line.call;
    std::string text = printable(call.function->name);
    if (call.has_entry && !line.is_open) text += "  " + durationText(call.total());
    // A code that is recorded whatever the result says nothing.
    if (call.code && call.function->recorded != trace::Recorded::kNothing) {
      text += "  = " + std::to_string(*call.code);
    }
    if (!call.has_entry) text += "  WITHOUT ENTRY";
    if (line.is_open) {
      text += "  CONTINUES";
    } else if (!call.has_exit) {
      text += "  UNFINISHED";
    }
    return call.failed == Failed::kYes ? coloured(text + "  FAILED", kRed) : text;
  }

  const bool only_failed_;
  const int64_t min_time_;
  const std::optional<std::string> function_;
  const bool is_json_;
  const bool has_colours_ = showsColours();
  bool is_first_ = true;
  Output output_{stdout, "standard output"};
  JsonObjects objects_;
  std::map<const Thread*, Pending> pending_;
  const Thread* last_thread_ = nullptr;
  Pending* last_ = nullptr;
  const Thread* shown_thread_ = nullptr;
  std::string shown_date_;
};

}  // namespace

Answer showTree(Tool& tool, Options& options) {
  Tree tree(options, tool.printsJson());
  const Reading reading = readCalls(tool, options, tree, true);
  tree.finish();
  return {};
}

}  // namespace traces
