// Traces with changed streams and metadata, for the reader of the trace commands.
//
// Each is read in a child of this process, because libbabeltrace2 may abort, or not end, over a trace. That is no
// finding while it parses the metadata and looks for packets, where nothing else runs, nor is an abort that it calls
// itself: osutils-trace ends there with a line. Everything else that ends the child is one.
#include <babeltrace2/babeltrace.h>
#include <dlfcn.h>
#include <execinfo.h>
#include <sanitizer/allocator_interface.h>
#include <signal.h>
#include <stddef.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "../tools/trace/calls.h"
#pragma clang diagnostic push
#pragma clang diagnostic ignored "-Wunused-private-field"  // by the Limits of this target
#include "../tools/trace/guard.h"
#pragma clang diagnostic pop
#include "fuzz.h"
#include "input.h"
#include "made_trace.h"

extern "C" {
extern uint8_t* const coverage_counters[2];  // their begin and their end
uint8_t* __llvm_profile_begin_counters();
uint8_t* __llvm_profile_end_counters();
}

// Declared in C++, these two would get in the way of the compiler's own declarations.
__asm__(R"(
  .pushsection .data.rel.ro, "aw"
  .balign 8
  .hidden __start___sancov_cntrs, __stop___sancov_cntrs
  coverage_counters: .quad __start___sancov_cntrs, __stop___sancov_cntrs
  .popsection
)");

namespace {

namespace fs = std::filesystem;

constexpr size_t kLongestInput = 4096;
constexpr size_t kMostFiles = 4;
constexpr size_t kMostAllocated = size_t{32} << 20;
constexpr int kMostSeconds = 5;
constexpr int kContained = 3;

// "ctf" and "utils".
const bt_plugin* plugins[2];

// ---- The child's counters of coverage ----

class Counters {
 public:
  void keep() {
    for (const auto& [begin, end, kept] : parts_) memcpy(kept, begin, size_t(end - begin));
  }
  void take() {
    for (const auto& [begin, end, kept] : parts_) memcpy(begin, kept, size_t(end - begin));
  }

 private:
  struct Part {
    uint8_t* begin;
    uint8_t* end;
    void* kept;
  };
  static Part part(uint8_t* begin, uint8_t* end) {
    void* const kept = mmap(nullptr, static_cast<size_t>(end - begin), PROT_READ | PROT_WRITE,
                            MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (kept == MAP_FAILED) giveUp("mmap");
    return {begin, end, kept};
  }

  const Part parts_[2] = {part(coverage_counters[0], coverage_counters[1]),
                          part(__llvm_profile_begin_counters(), __llvm_profile_end_counters())};
};

Counters& counters() {
  static Counters instance;
  return instance;
}

// ---- Limits ----

constexpr int kSignals[] = {SIGABRT, SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGPROF};

bool is_in_library = false;
bool is_in_child = false;
size_t allocated = 0;
struct sigaction before[std::size(kSignals)];
struct sigaction fuzzers_abort;

void end(int status) {
  counters().keep();
  _exit(status);
}
void onSignalInLibrary(int) { end(kContained); }
// The caller of abort() is the first function under those of the C library, which follow this one.
void onAbort(int signal) {
  void* frames[64];
  const int count = backtrace(frames, std::size(frames));
  bool is_under_handler = false;
  for (int i = 0; i < count; ++i) {
    Dl_info info;
    if (dladdr(frames[i], &info) == 0) continue;
    const std::string_view object = info.dli_fname;
    if (object.find("/libc.so") != object.npos || object.find("/libglib") != object.npos) {
      is_under_handler = true;
    } else if (is_under_handler) {
      if (object.find("babeltrace") != object.npos) end(kContained);
      break;
    }
  }
  sigaction(signal, &fuzzers_abort, nullptr);
  raise(signal);
}
void onTimeIsUp(int) { fail("the reading", "does not end", "an end"); }
void onMalloc(const volatile void*, size_t size) {
  if (!is_in_child) return;
  allocated += size;
  if (allocated < kMostAllocated) return;
  is_in_child = false;
  if (is_in_library) end(kContained);
  fail("memory for the reading", "more and more", "little");
}
void onFree(const volatile void*) {}

}  // namespace

// Instead of those of the program, which do not tell whose fault it is.
namespace traces {

Guard::Guard(const std::string&) {}
Guard::~Guard() {}

size_t callsSurvived(size_t calls, const std::function<void(size_t)>&) { return calls; }

Limits::Limits(const Folder&) {
  is_in_library = true;
  struct sigaction action = {};
  action.sa_handler = onSignalInLibrary;
  for (size_t i = 0; i < std::size(kSignals); ++i) sigaction(kSignals[i], &action, &before[i]);
}
Limits::~Limits() {
  is_in_library = false;
  for (size_t i = 0; i < std::size(kSignals); ++i) sigaction(kSignals[i], &before[i], nullptr);
}

}  // namespace traces

namespace {

// ---- What is promised ----

// Counts, and follows the calls of each thread.
class Follower : public traces::Visitor {
 public:
  void begin(const traces::Call& call) override {
    expectDepth(call.thread, call.depth);
    if (!call.has_entry || call.has_exit) fail("a call that begins", "not open", "open");
    open_[call.thread].push_back({call.function, call.begin});
    ++records_;
  }
  void end(const traces::Call& call) override {
    if (call.has_entry) {
      std::vector<Open>& stack = open_[call.thread];
      if (stack.empty() || stack.back().function != call.function ||
          stack.back().begin != call.begin) {
        fail("a call that ends", "another", "the innermost");
      }
      stack.pop_back();
    } else if (!call.has_exit || call.begin != call.end || call.children != 0) {
      fail("an exit without an entry", "with a time", "without one");
    }
    expectDepth(call.thread, call.depth);
    if (call.end < call.begin) fail("the time of a call", "negative", "0 or more");
    if (call.has_exit) ++records_;
  }
  void message(const traces::Message& message) override {
    expectDepth(message.thread, message.depth);
    text_bytes_ += message.text.size();
    ++records_;
  }

  void expectEnd(const traces::Reading& reading, size_t bytes) const {
    for (const auto& [thread, stack] : open_) {
      if (!stack.empty()) fail("the open calls of a thread", std::to_string(stack.size()), "0");
    }
    expectSame("the records", static_cast<long>(reading.records), static_cast<long>(records_));
    if (text_bytes_ > bytes) fail("the texts", std::to_string(text_bytes_), "fewer bytes");
    if ((reading.unreadable == 0) != reading.problems.empty())
      fail("the problems", std::to_string(reading.problems.size()), "a line for each");
  }

 private:
  struct Open {
    const traces::Function* function;
    int64_t begin;
  };
  void expectDepth(const traces::Thread* thread, unsigned depth) {
    expectSame("the depth", static_cast<long>(depth), static_cast<long>(open_[thread].size()));
  }

  std::map<const traces::Thread*, std::vector<Open>> open_;
  uint64_t records_ = 0;
  size_t text_bytes_ = 0;
};

// The number of events in a file of the usual metadata, if it has no error and no other file's stream.
std::optional<long> eventsIn(const std::string& file, std::set<uint64_t>& instances) {
  Input input(reinterpret_cast<const uint8_t*>(file.data()), file.size());
  long events = 0;
  uint64_t time = 0;
  std::optional<uint64_t> instance;
  while (!input.isAtEnd()) {
    const size_t before_packet = input.rest().size();
    if (before_packet < 64 || input.number<uint32_t>() != 0xC1FC1FC1) return {};
    if (input.number<uint32_t>() != 0) return {};
    const auto number = input.number<uint64_t>();
    if (instance.value_or(number) != number) return {};
    instance = number;
    const auto bits = input.number<uint64_t>();
    const uint64_t size = bits / 8;
    if (bits % 8 != 0 || size < 64 || size > before_packet) return {};
    if (input.number<uint64_t>() != bits) return {};
    const auto begin = input.number<uint64_t>(), end = input.number<uint64_t>();
    // All that nanoseconds since 1970 can hold.
    if (begin < time || end < begin || end > INT64_MAX) return {};
    time = begin;
    if (input.number<uint64_t>() != 0) return {};  // a number of missing records
    (void)input.number<uint64_t>();
    const size_t after_packet = before_packet - size;
    const auto has = [&](size_t bytes) { return input.rest().size() - after_packet >= bytes; };
    while (input.rest().size() > after_packet) {
      if (!has(12)) return {};
      const auto id = input.number<uint32_t>();
      const auto now = input.number<uint64_t>();
      if (now < time || now > end) return {};
      time = now;
      size_t fields = id == 0 ? 24 : id == 1 ? 32 : id == 2 ? 28 : 8;
      if (id > 3 || !has(fields)) return {};
      uint32_t length = 0;
      for (; fields >= 4; fields -= 4) length = input.number<uint32_t>();
      if (id == 2 && !has(length)) return {};
      for (; id == 2 && length > 0; --length) (void)input.byte();
      ++events;
    }
  }
  if (!instance || !instances.insert(*instance).second) return {};
  return events;
}

// The number of events that libbabeltrace2 finds. None after a failure.
std::optional<long> countedEvents(const std::string& path) {
  bt_graph* const graph = bt_graph_create(0);
  bt_value* const parameters = bt_value_map_create();
  bt_value* inputs = nullptr;
  bt_value_map_insert_empty_array_entry(parameters, "inputs", &inputs);
  bt_value_array_append_string_element(inputs, path.c_str());
  const bt_component_source* source = nullptr;
  const bt_component_filter* muxer = nullptr;
  const bt_component_sink* sink = nullptr;
  if (bt_graph_add_source_component(
          graph, bt_plugin_borrow_source_component_class_by_name_const(plugins[0], "fs"), "source",
          parameters, BT_LOGGING_LEVEL_NONE, &source) != BT_GRAPH_ADD_COMPONENT_STATUS_OK ||
      bt_graph_add_filter_component(
          graph, bt_plugin_borrow_filter_component_class_by_name_const(plugins[1], "muxer"),
          "muxer", nullptr, BT_LOGGING_LEVEL_NONE, &muxer) != BT_GRAPH_ADD_COMPONENT_STATUS_OK) {
    return {};
  }
  long events = 0;
  const auto consume = [](bt_message_iterator* iterator, void* data) {
    bt_message_array_const messages = nullptr;
    uint64_t count = 0;
    const bt_message_iterator_next_status status =
        bt_message_iterator_next(iterator, &messages, &count);
    if (status == BT_MESSAGE_ITERATOR_NEXT_STATUS_END)
      return BT_GRAPH_SIMPLE_SINK_COMPONENT_CONSUME_FUNC_STATUS_END;
    if (status != BT_MESSAGE_ITERATOR_NEXT_STATUS_OK)
      return BT_GRAPH_SIMPLE_SINK_COMPONENT_CONSUME_FUNC_STATUS_ERROR;
    for (uint64_t i = 0; i < count; ++i) {
      *static_cast<long*>(data) += bt_message_get_type(messages[i]) == BT_MESSAGE_TYPE_EVENT;
      bt_message_put_ref(messages[i]);
    }
    return BT_GRAPH_SIMPLE_SINK_COMPONENT_CONSUME_FUNC_STATUS_OK;
  };
  if (bt_graph_add_simple_sink_component(graph, "count", nullptr, consume, nullptr, &events,
                                         &sink) != BT_GRAPH_ADD_COMPONENT_STATUS_OK) {
    return {};
  }
  const auto connect = [&](const bt_port_output* from, const bt_port_input* to) {
    (void)bt_graph_connect_ports(graph, from, to, nullptr);
  };
  for (uint64_t i = 0; i < bt_component_source_get_output_port_count(source); ++i) {
    connect(bt_component_source_borrow_output_port_by_index_const(source, i),
            bt_component_filter_borrow_input_port_by_index_const(muxer, i));
  }
  connect(bt_component_filter_borrow_output_port_by_index_const(muxer, 0),
          bt_component_sink_borrow_input_port_by_index_const(sink, 0));
  if (bt_graph_run(graph) != BT_GRAPH_RUN_STATUS_OK) return {};
  return events;
}

// ---- Running ----

struct Trace {
  std::string metadata = kMadeMetadata;
  bool is_usual = true;  // the metadata
  std::vector<std::string> files;
};

// The first byte says what follows: files; metadata, for usual files; or metadata with its length, and files. Each file
// has its length before it.
Trace traceOf(Input& input) {
  Trace trace;
  const unsigned kind = input.byte() % 3U;
  trace.is_usual = kind == 0;
  if (kind == 1) {
    trace.metadata = input.rest();
    for (const unsigned thread : {70U, 71U}) {
      trace.files.push_back(MadeStream(thread)
                                .enter(100, kCopyFile)
                                .message(110, kCopyFile + 1, "a text")
                                .leave(120, kCopyFile, 1)
                                .other(130)
                                .file());
    }
    return trace;
  }
  const auto cut = [&] {
    std::string part;
    for (size_t size = input.number<uint16_t>(); size > 0 && !input.isAtEnd(); --size)
      part += static_cast<char>(input.byte());
    return part;
  };
  if (kind == 2) trace.metadata = cut();
  while (!input.isAtEnd() && trace.files.size() < kMostFiles) trace.files.push_back(cut());
  return trace;
}

void read(const std::string& path, const Trace& trace) {
  size_t bytes = 0;
  std::optional<long> events = 0;
  std::set<uint64_t> instances;
  for (const std::string& file : trace.files) {
    bytes += file.size();
    const std::optional<long> more = eventsIn(file, instances);
    events = events && more ? std::optional(*events + *more) : std::nullopt;
  }
  Follower follower;
  const traces::Reading reading = traces::read({path}, {}, follower);
  follower.expectEnd(reading, bytes);
  const auto found = static_cast<long>(reading.records + reading.foreign);
  if (reading.records + reading.foreign > bytes * 8) fail("the events", "more", "than bits");
  if (reading.unreadable == 0) {
    if (const bt_error* const error = bt_current_thread_take_error())
      fail("a failure", bt_error_cause_get_message(bt_error_borrow_cause_by_index(error, 0)), "");
    const std::optional<long> counted = countedEvents(path);
    if (counted) expectSame("the events", found, *counted);
  }
  if (!trace.is_usual) return;
  if (reading.records * 36 + reading.foreign * 20 > bytes)
    fail("the events", std::to_string(found), "fewer");
  if (events) {
    expectSame("the events of a valid trace", found, *events);
    expectSame("what could not be read", static_cast<long>(reading.unreadable), 0);
  }
}

const Folder& folder() {
  static const Folder instance;
  return instance;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fs::create_directory(folder().path("temporary"));
  setenv("TMPDIR", folder().path("temporary").c_str(), 1);
  (void)counters();
  __sanitizer_install_malloc_and_free_hooks(onMalloc, onFree);
  // All that the search loads stays loaded, which saves the children time.
  static const bt_plugin_set* all = nullptr;
  (void)bt_plugin_find_all(BT_FALSE, BT_FALSE, BT_TRUE, BT_TRUE, BT_FALSE, &all);
  const char* const names[] = {"ctf", "utils"};
  for (size_t i = 0; i < std::size(names); ++i) {
    if (bt_plugin_find(names[i], BT_FALSE, BT_FALSE, BT_TRUE, BT_TRUE, BT_TRUE, &plugins[i]) !=
        BT_PLUGIN_FIND_STATUS_OK) {
      giveUp(names[i]);
    }
  }
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kLongestInput) return -1;
  Input input(data, size);
  const Trace trace = traceOf(input);
  const std::string path = folder().path("trace");
  fs::remove_all(path);
  fs::create_directory(path);
  writeTo(path + "/metadata", trace.metadata);
  for (size_t i = 0; i < trace.files.size(); ++i)
    writeTo(path + "/stream-" + std::to_string(i), trace.files[i]);

  const pid_t child = fork();
  if (child == -1) giveUp("fork");
  if (child == 0) {
    is_in_child = true;
    signal(SIGPROF, onTimeIsUp);
    sigaction(SIGABRT, nullptr, &fuzzers_abort);
    signal(SIGABRT, onAbort);
    const itimerval timer = {{0, 0}, {kMostSeconds, 0}};
    setitimer(ITIMER_PROF, &timer, nullptr);
    read(path, trace);
    end(0);
  }
  int status = 0;
  while (waitpid(child, &status, 0) != child) {
    if (errno != EINTR) giveUp("waitpid");  // libFuzzer's timer
  }
  // Otherwise the child has written a report, and the input into a file.
  if (!WIFEXITED(status) || (WEXITSTATUS(status) != 0 && WEXITSTATUS(status) != kContained))
    _exit(77);
  if (WEXITSTATUS(status) == kContained) {
    fs::remove_all(folder().path("temporary"));
    fs::create_directory(folder().path("temporary"));
  }
  counters().take();
  return 0;
}
