// trace export: calls and messages in the formats of other programs.
#include <algorithm>
#include <deque>
#include <map>
#include <set>

#include "text.h"
#include "view.h"

namespace traces {
namespace {

class FirstMoment : public Visitor {
 public:
  void begin(const Call& call) override { take(call.begin); }
  void end(const Call& call) override { take(call.begin); }
  void message(const Message& message) override { take(message.time); }

  int64_t moment() const { return moment_.value_or(0); }

 private:
  void take(int64_t time) { moment_ = std::min(time, moment_.value_or(time)); }

  std::optional<int64_t> moment_;
};

// The Trace Event Format, as an object with a list of events. Times are microseconds since `start`: since 1970 they
// would have more digits than the numbers of JavaScript.
class ChromeWriter : public Visitor {
 public:
  ChromeWriter(Output& output, int64_t start) : output_(output), start_(start) {
    output_.add(R"({"displayTimeUnit":"ns","otherData":{"start":")" + timeText(start_) +
                R"("},"traceEvents":[)");
  }

  void end(const Call& call) override {
    const std::string& name = functions_.of(*call.function);
    if (!call.has_exit) {
      add(*call.thread, R"("ph":"B","name":)" + name, call.begin, "");
      return;
    }
    std::string rest = R"(,"args":{)";
    if (call.code) {
      rest += R"("code":)";
      append(rest, *call.code);
      if (call.failed == Failed::kYes) rest += R"(,"failed":true)";
    }
    rest += '}';
    if (!call.has_entry) {
      add(*call.thread, R"("ph":"i","s":"t","name":)" + name, call.end, rest);
      return;
    }
    rest += R"(,"dur":)";
    appendMicroseconds(rest, call.total());
    add(*call.thread, R"("ph":"X","name":)" + name, call.begin, rest);
  }

  void message(const Message& message) override {
    const char* const name = message.is_error ? R"("error message")" : R"("message")";
    add(*message.thread, std::string(R"("ph":"i","s":"t","name":)") + name, message.time,
        R"(,"args":{"function":)" + functions_.of(*message.function) + R"(,"text":)" +
            jsonText(message.text) + '}');
  }

  void finish() {
    output_.add("\n]}\n");
    output_.write();
  }

 private:
  // Linux has no such process id.
  static constexpr int64_t kFirstMadeId = int64_t{1} << 22;

  static void appendMicroseconds(std::string& text, int64_t nanoseconds) {
    append(text, nanoseconds / 1000);
    const std::string digits = std::to_string(1000 + nanoseconds % 1000);
    text += '.' + digits.substr(1);
  }

  void add(const Thread& thread, const std::string& what, int64_t time, const std::string& rest) {
    const int64_t pid = pidOf(*thread.process);
    if (threads_.emplace(pid, thread.id).second) {
      addName("thread_name", pid, thread.id, "thread " + std::to_string(thread.id));
    }
    std::string event = opening() + what + R"(,"ts":)";
    appendMicroseconds(event, time - start_);
    event += R"(,"pid":)";
    append(event, pid);
    event += R"(,"tid":)";
    append(event, thread.id);
    output_.add(event + rest + '}');
  }

  void addName(const char* what, int64_t pid, uint64_t tid, const std::string& name) {
    output_.add(opening() + R"("ph":"M","name":")" + what + R"(","pid":)" + std::to_string(pid) +
                R"(,"tid":)" + std::to_string(tid) + R"(,"args":{"name":)" + jsonText(name) + "}}");
  }

  std::string opening() {
    const bool is_first = is_first_;
    is_first_ = false;
    return is_first ? "\n{" : ",\n{";
  }

  // The process's own id, unless a process of another host or program has it.
  int64_t pidOf(const Process& process) {
    const auto known = ids_.find(&process);
    if (known != ids_.end()) return known->second;
    int64_t id = process.id;
    while (!used_ids_.insert(id).second) id = next_made_id_++;
    ids_.emplace(&process, id);
    addName("process_name", id, 0,
            process.program + ' ' + std::to_string(process.id) +
                (process.host.empty() ? "" : " on " + process.host));
    return id;
  }

  Output& output_;
  const int64_t start_;
  FunctionTexts functions_;
  std::map<const Process*, int64_t> ids_;
  std::set<int64_t> used_ids_;
  std::set<std::pair<int64_t, uint64_t>> threads_;
  int64_t next_made_id_ = kFirstMadeId;
  bool is_first_ = true;
};

// Folded stacks: "program;function;function NANOSECONDS", the own time of the last function.
class FoldedWriter : public Visitor {
 public:
  void begin(const Call& call) override {
    std::vector<size_t>& stack = stackOf(*call.thread);
    size_t around = 0;
    if (!stack.empty()) {
      around = stack.back();
    } else {
      around = nodeOf({kNone, call.thread->process->program});
    }
    stack.push_back(nodeOf({around, call.function->name}));
  }

  void end(const Call& call) override {
    if (!call.has_entry) return;
    std::vector<size_t>& stack = stackOf(*call.thread);
    if (call.has_exit) nodes_[stack.back()].time += call.own();
    stack.pop_back();
  }

  void write(Output& output) const {
    for (const Node& node : nodes_) {
      if (node.time <= 0) continue;
      std::vector<const Node*> frames = {&node};
      while (frames.back()->around != kNone) frames.push_back(&nodes_[frames.back()->around]);
      std::string line;
      for (auto frame = frames.rbegin(); frame != frames.rend(); ++frame) {
        line += (line.empty() ? "" : ";") + (*frame)->name;
      }
      output.add(line + ' ' + std::to_string(node.time) + '\n');
    }
    output.write();
  }

 private:
  static constexpr size_t kNone = SIZE_MAX;

  using Place = std::pair<size_t, std::string>;  // the node around it, and a name
  struct Node {
    size_t around;
    std::string name;
    int64_t time = 0;
  };

  // A semicolon would end the frame, and a line break the line.
  static std::string frameOf(const std::string& name) {
    std::string frame = printable(name);
    std::replace(frame.begin(), frame.end(), ';', ':');
    return frame.empty() ? "?" : frame;
  }

  std::vector<size_t>& stackOf(const Thread& thread) {
    if (&thread != last_thread_) {
      last_thread_ = &thread;
      last_stack_ = &stacks_[&thread];
    }
    return *last_stack_;
  }

  size_t nodeOf(const Place& place) {
    const auto [found, is_new] = places_.try_emplace(place, nodes_.size());
    if (is_new) nodes_.push_back({place.first, frameOf(place.second)});
    return found->second;
  }

  std::deque<Node> nodes_;
  std::map<Place, size_t> places_;
  std::map<const Thread*, std::vector<size_t>> stacks_;
  const Thread* last_thread_ = nullptr;
  std::vector<size_t>* last_stack_ = nullptr;
};

// An object a line: calls where they end.
class LineWriter : public Visitor {
 public:
  explicit LineWriter(Output& output) : output_(output) {}
  void end(const Call& call) override { output_.add(objects_.of(call) + '\n'); }
  void message(const Message& message) override { output_.add(objects_.of(message) + '\n'); }

 private:
  Output& output_;
  JsonObjects objects_;
};

}  // namespace

Answer exportCalls(Tool& tool, Options& options) {
  if (!options.format) throw Usage("--format is missing: chrome, folded or jsonl");
  if (tool.printsJson()) throw Usage("--json excludes --format");
  const std::string& format = *options.format;
  Output output(stdout, "standard output");
  if (format == "chrome") {
    FirstMoment first;
    const Reading reading = readCalls(tool, options, first);
    ChromeWriter writer(output, first.moment());
    (void)readAgain(tool, options, writer, reading, true);
    writer.finish();
  } else if (format == "folded") {
    FoldedWriter writer;
    (void)readCalls(tool, options, writer);
    writer.write(output);
  } else if (format == "jsonl") {
    LineWriter writer(output);
    (void)readCalls(tool, options, writer, true);
    output.write();
  } else {
    throw Usage("--format is not chrome, folded or jsonl: " + inQuotes(format));
  }
  return {};
}

}  // namespace traces
