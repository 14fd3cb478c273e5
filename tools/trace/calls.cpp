#include "calls.h"

#include <babeltrace2/babeltrace.h>
#include <inttypes.h>
#include <stdio.h>

#include <algorithm>
#include <array>
#include <deque>
#include <exception>
#include <iterator>
#include <limits>
#include <memory>
#include <stdexcept>
#include <tuple>
#include <unordered_map>
#include <utility>

#include "folders.h"
#include "guard.h"

namespace traces {
namespace {

constexpr uint64_t kRecordsPerProgress = 65'536;
constexpr size_t kMostProblems = 10;  // that get a line of their own
constexpr uint64_t kAbsent = UINT64_MAX;

template <typename Object, void (*put)(const Object*)>
struct Put {
  void operator()(const Object* object) const { put(object); }
};
template <typename Object, void (*put)(const Object*)>
using Reference = std::unique_ptr<const Object, Put<Object, put>>;
using Plugin = Reference<bt_plugin, bt_plugin_put_ref>;
using Value = Reference<bt_value, bt_value_put_ref>;
using Iterator = Reference<bt_message_iterator, bt_message_iterator_put_ref>;
using SinkClass = Reference<bt_component_class_sink, bt_component_class_sink_put_ref>;

struct PutGraph {
  void operator()(bt_graph* graph) const { bt_graph_put_ref(graph); }
};
using Graph = std::unique_ptr<bt_graph, PutGraph>;

using Error = Reference<bt_error, bt_error_release>;

// What libbabeltrace2 says about a failure, if there was one.
std::optional<std::string> pendingError() {
  const Error error(bt_current_thread_take_error());
  if (!error) return std::nullopt;
  return bt_error_cause_get_message(bt_error_borrow_cause_by_index(error.get(), 0));
}

// The same after a call that has failed.
std::string takeError() { return pendingError().value_or("libbabeltrace2 failed"); }

// For calls that fail for lack of memory only.
void require(bool is_done) {
  if (!is_done) throw std::runtime_error(takeError());
}

Plugin findPlugin(const char* name) {
  // Only those of the system: a user's or the environment's could be anything.
  const bt_plugin* plugin = nullptr;
  if (bt_plugin_find(name, BT_FALSE, BT_FALSE, BT_TRUE, BT_TRUE, BT_FALSE, &plugin) !=
      BT_PLUGIN_FIND_STATUS_OK) {
    throw std::runtime_error(std::string("cannot load libbabeltrace2's plugin \"") + name +
                             "\": " + takeError());
  }
  return Plugin(plugin);
}

struct Known {
  uint64_t number;
  const char* name;
  std::optional<trace::Recorded> recorded;
};

constexpr Known kKnownFunctions[] = {
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  {trace::functionId(module, ordinal), name, trace::Recorded::recorded},
#include "trace_functions.def"
#undef TRACE_FUNCTION
    {trace::kOrdinaryLevel & ~trace::kLevelByte, "ldtr_fun", std::nullopt},
    {trace::kErrorLevel & ~trace::kLevelByte, "ldtr_fun", std::nullopt},
};

const Known* knownFunction(uint64_t number) {
  const auto* const found =
      std::find_if(std::begin(kKnownFunctions), std::end(kKnownFunctions),
                   [number](const Known& known) { return known.number == number; });
  return found == std::end(kKnownFunctions) ? nullptr : found;
}

Failed failedOf(std::optional<trace::Recorded> recorded, std::optional<int64_t> code) {
  if (!recorded || !code) return Failed::kUnknown;
  switch (*recorded) {
    case trace::Recorded::kCode:
      return *code == 0 ? Failed::kNo : Failed::kYes;
    case trace::Recorded::kSuccess:
      return *code == 0 ? Failed::kYes : Failed::kNo;
    case trace::Recorded::kAnswer:
      return Failed::kNo;
    case trace::Recorded::kNumber:
      return *code < 0 ? Failed::kYes : Failed::kNo;
    case trace::Recorded::kNothing:
      break;
  }
  return Failed::kUnknown;
}

// ---- Fields ----

int64_t integerOf(const bt_field* field) {
  if (bt_field_class_type_is(bt_field_get_class_type(field),
                             BT_FIELD_CLASS_TYPE_UNSIGNED_INTEGER)) {
    return static_cast<int64_t>(bt_field_integer_unsigned_get_value(field));
  }
  return bt_field_integer_signed_get_value(field);
}

bool isInteger(const bt_field_class* field) {
  return bt_field_class_type_is(bt_field_class_get_type(field), BT_FIELD_CLASS_TYPE_INTEGER);
}

bool isText(const bt_field_class* field) {
  const bt_field_class_type type = bt_field_class_get_type(field);
  if (bt_field_class_type_is(type, BT_FIELD_CLASS_TYPE_STRING)) return true;
  return bt_field_class_type_is(type, BT_FIELD_CLASS_TYPE_ARRAY) &&
         isInteger(bt_field_class_array_borrow_element_field_class_const(field));
}

void readText(const bt_field* field, std::string& text) {
  text.clear();
  if (bt_field_class_type_is(bt_field_get_class_type(field), BT_FIELD_CLASS_TYPE_STRING)) {
    text.assign(bt_field_string_get_value(field), bt_field_string_get_length(field));
    return;
  }
  const uint64_t length = bt_field_array_get_length(field);
  for (uint64_t i = 0; i < length; ++i) {
    const bt_field* const element = bt_field_array_borrow_element_field_by_index_const(field, i);
    text += static_cast<char>(integerOf(element));
  }
}

// A member of a structure that has it.
struct Member {
  uint64_t index = kAbsent;

  explicit operator bool() const { return index != kAbsent; }
  const bt_field* of(const bt_field* structure) const {
    return bt_field_structure_borrow_member_field_by_index_const(structure, index);
  }
};

Member memberNamed(const bt_field_class* structure, const char* name,
                   bool (*fits)(const bt_field_class*)) {
  if (structure == nullptr) return {};
  for (uint64_t i = 0; i < bt_field_class_structure_get_member_count(structure); ++i) {
    const bt_field_class_structure_member* const member =
        bt_field_class_structure_borrow_member_by_index_const(structure, i);
    if (std::string_view(bt_field_class_structure_member_get_name(member)) == name) {
      return fits(bt_field_class_structure_member_borrow_field_class_const(member)) ? Member{i}
                                                                                    : Member{};
    }
  }
  return {};
}

// A context's members that say whose record it is.
struct Owner {
  Member program;
  Member process;
  Member thread;
};

Owner ownerIn(const bt_field_class* context) {
  Owner owner{memberNamed(context, "procname", isText), memberNamed(context, "vpid", isInteger),
              memberNamed(context, "vtid", isInteger)};
  if (!owner.process) owner.process = memberNamed(context, "pid", isInteger);
  if (!owner.thread) owner.thread = memberNamed(context, "tid", isInteger);
  return owner;
}

// Where an event class has what.
struct Layout {
  bool fits = false;  // a traced function's event
  Member type;
  Member function;
  Member code;
  Member text;
  Owner common;    // the stream's context of events
  Owner specific;  // the event's own
  Member packet;   // the thread, in the packet's context
};

Layout layoutOf(const bt_event_class* event) {
  const bt_stream_class* const stream = bt_event_class_borrow_stream_class_const(event);
  const bt_field_class* const payload = bt_event_class_borrow_payload_field_class_const(event);
  Layout layout;
  layout.type = memberNamed(payload, "type", isInteger);
  layout.function = memberNamed(payload, "function", isInteger);
  layout.code = memberNamed(payload, "code", isInteger);
  layout.text = memberNamed(payload, "text", isText);
  layout.common = ownerIn(bt_stream_class_borrow_event_common_context_field_class_const(stream));
  layout.specific = ownerIn(bt_event_class_borrow_specific_context_field_class_const(event));
  layout.packet = ownerIn(bt_stream_class_borrow_packet_context_field_class_const(stream)).thread;
  layout.fits = layout.type && layout.function &&
                bt_stream_class_borrow_default_clock_class_const(stream) != nullptr;
  return layout;
}

// True if every stream of the trace is one thread: its packets say which.
bool isThreadInPackets(const bt_trace_class* trace) {
  for (uint64_t i = 0; i < bt_trace_class_get_stream_class_count(trace); ++i) {
    const bt_stream_class* const stream =
        bt_trace_class_borrow_stream_class_by_index_const(trace, i);
    if (!ownerIn(bt_stream_class_borrow_packet_context_field_class_const(stream)).thread) {
      return false;
    }
  }
  return true;
}

// ---- Calls ----

struct OpenCall {
  Call call;
  bool is_visible;
};

struct ThreadState {
  Thread thread;
  std::vector<OpenCall> stack;
  std::unordered_map<const Function*, size_t> open;    // the functions in the stack, and how often
  unsigned visible = 0;                                // of the stack
  int64_t last = std::numeric_limits<int64_t>::min();  // the latest time of its records
  std::optional<int64_t> last_before;                  // in the first reading
};

using ThreadName = std::tuple<std::string, std::string, int64_t, uint64_t>;  // in any reading
using Uuid = std::array<uint8_t, 16>;

class Reader {
 public:
  Reader(const Settings& settings, Visitor& visitor)
      : settings_(settings),
        visitor_(visitor),
        ctf_(findPlugin("ctf")),
        utils_(findPlugin("utils")) {
    if (settings.first == nullptr) return;
    for (const ThreadState& state :
         static_cast<const Reader*>(settings.first->kept.get())->threads_) {
      int64_t& last = last_before_.try_emplace(nameOf(state.thread), state.last).first->second;
      last = std::max(last, state.last);
    }
  }

  void readFolders(const std::vector<Folder>& folders);
  void finish();  // the threads whose records are in several streams

  // For the sink component, whose ports they read.
  void addPorts(bt_self_component_sink* sink);
  void readPorts(bt_self_component_sink* sink);

  Reading reading;
  uint64_t expected_packets = 0;

 private:
  enum class Order { kByThread, kByTime };

  void openAsForReading(const Folder& folder);
  void readFolder(const Folder& folder);
  std::optional<std::string> open(const std::string& path, Order order, Graph& graph);
  std::optional<std::string> readWhole(const std::string& path);
  bool isReadable(const Folder& folder, const std::vector<std::string>& files);
  void findReadable(const Folder& folder, const std::vector<std::string>& files,
                    std::vector<std::string>& readable);
  void readPort(bt_self_component_sink* sink, uint64_t index);
  void take(const bt_message* message);
  void takePacket(const bt_packet* packet);
  void takeEvent(const bt_message* message);
  void enter(ThreadState& state, Function& function, int64_t time);
  void leave(ThreadState& state, Function& function, int64_t time, std::optional<int64_t> code);
  void leaveUnfinished(ThreadState& state, int64_t time);
  void endTop(ThreadState& state);
  void endThread(ThreadState& state);

  const Layout& layoutOfClass(const bt_event_class* event);
  Function& functionOf(uint64_t number, const bt_field* field);
  ThreadState& addThread(const Process* process, uint64_t id);
  ThreadState& stateOf(const Layout& layout, const bt_event* event);
  const Process* processOf(const bt_trace* trace, const std::string* program, const int64_t* id);
  static ThreadName nameOf(const Thread& thread) {
    const Process& process = *thread.process;
    return {process.host, process.program, process.id, thread.id};
  }
  bool isVisible(int64_t time) const { return time >= settings_.from && time < settings_.to; }
  void addUnreadable(const std::string& why);

  const Settings& settings_;
  Visitor& visitor_;
  Plugin ctf_;
  Plugin utils_;

  // Of the folder that is read.
  const Folder* current_ = nullptr;
  Order order_ = Order::kByThread;
  uint64_t ports_ = 0;
  bool needs_order_by_time_ = false;
  std::unordered_map<const bt_event_class*, Layout> layouts_;
  ThreadState* of_stream_ = nullptr;  // the thread that all of the stream's records are from
  std::exception_ptr exception_;      // does not pass through libbabeltrace2

  uint64_t events_left_ = 0;  // more than that the files cannot have
  bool is_endless_ = false;
  uint64_t events_left_before_packet_ = 0;
  uint64_t packets_ = 0;  // that had events and are read: of libtrc, one of each file
  uint64_t next_progress_ = kRecordsPerProgress;
  std::string text_;
  std::map<std::tuple<std::string, std::string, int64_t>, Process> processes_;
  std::deque<Function> functions_;
  std::unordered_map<uint64_t, Function*> functions_by_number_;
  std::deque<ThreadState> threads_;
  std::map<std::tuple<Uuid, int64_t, int64_t>, ThreadState*> threads_by_id_;
  std::map<ThreadName, int64_t> last_before_;  // the latest times of the first reading
};

bt_component_class_initialize_method_status initializeSink(bt_self_component_sink* sink,
                                                           bt_self_component_sink_configuration*,
                                                           const bt_value*, void* data) {
  bt_self_component_set_data(bt_self_component_sink_as_self_component(sink), data);
  static_cast<Reader*>(data)->addPorts(sink);
  return BT_COMPONENT_CLASS_INITIALIZE_METHOD_STATUS_OK;
}

bt_component_class_sink_consume_method_status consume(bt_self_component_sink* sink) {
  static_cast<Reader*>(bt_self_component_get_data(bt_self_component_sink_as_self_component(sink)))
      ->readPorts(sink);
  return BT_COMPONENT_CLASS_SINK_CONSUME_METHOD_STATUS_END;
}

void Reader::addPorts(bt_self_component_sink* sink) {
  for (uint64_t i = 0; i < ports_; ++i) {
    (void)bt_self_component_sink_add_input_port(sink, std::to_string(i).c_str(), nullptr, nullptr);
  }
}

// Makes the graph. Returns why it cannot be made.
std::optional<std::string> Reader::open(const std::string& path, Order order, Graph& graph) {
  order_ = order;
  layouts_.clear();
  bt_current_thread_clear_error();  // of a reading that was given up: it would abort
  graph.reset(bt_graph_create(0));
  require(graph != nullptr);

  bt_value* const parameters = bt_value_map_create();
  const Value owned_parameters(parameters);
  require(parameters != nullptr);
  bt_value* inputs = nullptr;
  require(bt_value_map_insert_empty_array_entry(parameters, "inputs", &inputs) ==
          BT_VALUE_MAP_INSERT_ENTRY_STATUS_OK);
  require(bt_value_array_append_string_element(inputs, path.c_str()) ==
          BT_VALUE_ARRAY_APPEND_ELEMENT_STATUS_OK);
  const bt_component_class_source* const fs =
      bt_plugin_borrow_source_component_class_by_name_const(ctf_.get(), "fs");
  const bt_component_source* source = nullptr;
  {
    const Limits limits(*current_);
    if (bt_graph_add_source_component(graph.get(), fs, "source", parameters, BT_LOGGING_LEVEL_NONE,
                                      &source) != BT_GRAPH_ADD_COMPONENT_STATUS_OK) {
      return takeError();
    }
  }
  const uint64_t streams = bt_component_source_get_output_port_count(source);
  ports_ = order == Order::kByThread ? streams : 1;

  const SinkClass sink_class(bt_component_class_sink_create("calls", consume));
  require(sink_class != nullptr);
  auto* const made = const_cast<bt_component_class_sink*>(sink_class.get());
  (void)bt_component_class_sink_set_initialize_method(made, initializeSink);
  const bt_component_sink* sink = nullptr;
  require(bt_graph_add_sink_component_with_initialize_method_data(
              graph.get(), made, "calls", nullptr, this, BT_LOGGING_LEVEL_NONE, &sink) ==
          BT_GRAPH_ADD_COMPONENT_STATUS_OK);

  const auto connect = [&graph](const bt_port_output* from, const bt_port_input* to) {
    require(bt_graph_connect_ports(graph.get(), from, to, nullptr) ==
            BT_GRAPH_CONNECT_PORTS_STATUS_OK);
  };
  if (order == Order::kByThread) {
    for (uint64_t i = 0; i < streams; ++i) {
      connect(bt_component_source_borrow_output_port_by_index_const(source, i),
              bt_component_sink_borrow_input_port_by_index_const(sink, i));
    }
    return std::nullopt;
  }
  const bt_component_class_filter* const muxer_class =
      bt_plugin_borrow_filter_component_class_by_name_const(utils_.get(), "muxer");
  const bt_component_filter* muxer = nullptr;
  require(bt_graph_add_filter_component(graph.get(), muxer_class, "muxer", nullptr,
                                        BT_LOGGING_LEVEL_NONE,
                                        &muxer) == BT_GRAPH_ADD_COMPONENT_STATUS_OK);
  for (uint64_t i = 0; i < streams; ++i) {  // each connection makes the next port
    connect(bt_component_source_borrow_output_port_by_index_const(source, i),
            bt_component_filter_borrow_input_port_by_index_const(muxer, i));
  }
  connect(bt_component_filter_borrow_output_port_by_index_const(muxer, 0),
          bt_component_sink_borrow_input_port_by_index_const(sink, 0));
  return std::nullopt;
}

// Returns why nothing could be read.
std::optional<std::string> Reader::readWhole(const std::string& path) {
  for (const Order order : {Order::kByThread, Order::kByTime}) {
    needs_order_by_time_ = false;
    Graph graph;
    if (std::optional<std::string> failure = open(path, order, graph)) return failure;
    require(bt_graph_run(graph.get()) == BT_GRAPH_RUN_STATUS_OK);
    if (exception_) std::rethrow_exception(exception_);
    if (!needs_order_by_time_) break;
  }
  ++reading.traces;
  return std::nullopt;
}

// libbabeltrace2 2.1 aborts over less.
bool hasMetadata(const Folder& folder) { return folder.metadata_bytes >= 4; }

void Reader::readFolders(const std::vector<Folder>& folders) {
  // One that ends the process must not end the reading of the others.
  std::vector<bool> ends_process(folders.size(), false);
  for (size_t at = 0; folders.size() > 1 && at < folders.size(); ++at) {
    at += callsSurvived(folders.size() - at, [&](size_t i) {
      current_ = &folders[at + i];
      if (hasMetadata(*current_)) openAsForReading(*current_);
    });
    if (at < folders.size()) ends_process[at] = true;
  }
  for (size_t i = 0; i < folders.size(); ++i) {
    current_ = &folders[i];
    if (ends_process[i]) {
      addUnreadable("libbabeltrace2 fails over this folder");
    } else {
      readFolder(folders[i]);
    }
  }
}

// Opens all that readFolder() opens.
void Reader::openAsForReading(const Folder& folder) {
  {
    Graph graph;
    if (!open(folder.path, Order::kByThread, graph)) return;
  }
  std::vector<std::string> readable;
  if (isReadable(folder, {})) findReadable(folder, folder.files, readable);
}

void Reader::readFolder(const Folder& folder) {
  if (!hasMetadata(folder)) {
    addUnreadable("cannot read the file metadata");
    return;
  }
  events_left_ = 8 * folder.bytes;  // none has less than a bit
  const Guard guard(folder.path);
  const std::optional<std::string> failure = readWhole(folder.path);
  if (!failure) return;
  if (!isReadable(folder, {})) {
    addUnreadable(*failure);
    return;
  }
  std::vector<std::string> readable;
  findReadable(folder, folder.files, readable);
  const PartOfFolder part(folder, readable);
  if (const std::optional<std::string> again = readWhole(part.path())) addUnreadable(*again);
}

bool Reader::isReadable(const Folder& folder, const std::vector<std::string>& files) {
  const PartOfFolder part(folder, files);
  Graph graph;
  return !open(part.path(), Order::kByThread, graph);
}

// Adds those of the files that can be read, and reports the others.
void Reader::findReadable(const Folder& folder, const std::vector<std::string>& files,
                          std::vector<std::string>& readable) {
  if (files.empty() || isReadable(folder, files)) {
    readable.insert(readable.end(), files.begin(), files.end());
    return;
  }
  if (files.size() == 1) {
    addUnreadable("cannot read the file " + files.front());
    return;
  }
  const auto middle = files.begin() + static_cast<ptrdiff_t>(files.size() / 2);
  findReadable(folder, {files.begin(), middle}, readable);
  findReadable(folder, {middle, files.end()}, readable);
}

void Reader::readPorts(bt_self_component_sink* sink) {
  try {
    for (uint64_t i = 0; i < ports_ && !needs_order_by_time_; ++i) readPort(sink, i);
  } catch (...) {
    exception_ = std::current_exception();
  }
}

void Reader::readPort(bt_self_component_sink* sink, uint64_t index) {
  bt_message_iterator* made = nullptr;
  if (bt_message_iterator_create_from_sink_component(
          sink, bt_self_component_sink_borrow_input_port_by_index(sink, index), &made) !=
      BT_MESSAGE_ITERATOR_CREATE_FROM_SINK_COMPONENT_STATUS_OK) {
    addUnreadable(takeError());
    return;
  }
  const Iterator iterator(made);
  of_stream_ = nullptr;
  while (true) {
    bt_message_array_const messages = nullptr;
    uint64_t count = 0;
    const bt_message_iterator_next_status status =
        bt_message_iterator_next(made, &messages, &count);
    if (status != BT_MESSAGE_ITERATOR_NEXT_STATUS_OK) {
      // Its reader of CTF may leave an error and end as if all had been read.
      const std::optional<std::string> failure =
          status == BT_MESSAGE_ITERATOR_NEXT_STATUS_END ? pendingError() : takeError();
      if (failure) addUnreadable(*failure);
      break;
    }
    // All of the array's references are the receiver's.
    struct Batch {
      bt_message_array_const messages;
      uint64_t count;
      ~Batch() {
        for (uint64_t i = 0; i < count; ++i) bt_message_put_ref(messages[i]);
      }
    } const batch{messages, count};
    for (uint64_t i = 0; i < count && !needs_order_by_time_ && !is_endless_; ++i) take(messages[i]);
    if (needs_order_by_time_) return;
    if (std::exchange(is_endless_, false)) {
      addUnreadable("events without contents, without an end");
      break;
    }
  }
  if (of_stream_ != nullptr) endThread(*of_stream_);
}

void Reader::take(const bt_message* message) {
  const bt_message_type type = bt_message_get_type(message);
  if (type == BT_MESSAGE_TYPE_EVENT) {
    takeEvent(message);
  } else if (type == BT_MESSAGE_TYPE_STREAM_BEGINNING) {
    const bt_trace* const trace =
        bt_stream_borrow_trace_const(bt_message_stream_beginning_borrow_stream_const(message));
    needs_order_by_time_ = order_ == Order::kByThread && ports_ > 1 &&
                           !isThreadInPackets(bt_trace_borrow_class_const(trace));
  } else if (type == BT_MESSAGE_TYPE_PACKET_BEGINNING) {
    events_left_before_packet_ = events_left_;
    takePacket(bt_message_packet_beginning_borrow_packet_const(message));
  } else if (type == BT_MESSAGE_TYPE_PACKET_END) {
    if (events_left_ != events_left_before_packet_) ++packets_;
  } else if (type == BT_MESSAGE_TYPE_DISCARDED_EVENTS) {
    uint64_t count = 0;
    if (bt_message_discarded_events_get_count(message, &count) ==
        BT_PROPERTY_AVAILABILITY_AVAILABLE) {
      reading.discarded += count;
    }
  }
}

// Finds the thread of the stream, if its packets say which.
void Reader::takePacket(const bt_packet* packet) {
  if (order_ != Order::kByThread || of_stream_ != nullptr) return;
  const bt_field* const context = bt_packet_borrow_context_field_const(packet);
  if (context == nullptr) return;
  const Owner owner = ownerIn(bt_field_borrow_class_const(context));
  if (!owner.thread) return;
  const bt_trace* const trace = bt_stream_borrow_trace_const(bt_packet_borrow_stream_const(packet));
  of_stream_ = &addThread(processOf(trace, nullptr, nullptr),
                          static_cast<uint64_t>(integerOf(owner.thread.of(context))));
}

ThreadState& Reader::addThread(const Process* process, uint64_t id) {
  ThreadState& state = threads_.emplace_back();
  state.thread = {process, id};
  const auto before = last_before_.find(nameOf(state.thread));
  if (before != last_before_.end()) state.last_before = before->second;
  return state;
}

const Layout& Reader::layoutOfClass(const bt_event_class* event) {
  const auto found = layouts_.find(event);
  if (found != layouts_.end()) return found->second;
  return layouts_.emplace(event, layoutOf(event)).first->second;
}

void Reader::takeEvent(const bt_message* message) {
  if (events_left_ == 0) {
    is_endless_ = true;
    return;
  }
  --events_left_;
  const bt_event* const event = bt_message_event_borrow_event_const(message);
  const Layout& layout = layoutOfClass(bt_event_borrow_class_const(event));
  int64_t time = 0;
  if (!layout.fits || bt_clock_snapshot_get_ns_from_origin(
                          bt_message_event_borrow_default_clock_snapshot_const(message), &time) !=
                          BT_CLOCK_SNAPSHOT_GET_NS_FROM_ORIGIN_STATUS_OK) {
    // A time that is too large leaves an error, over which libbabeltrace2 aborts at the next trace.
    bt_current_thread_clear_error();
    ++reading.foreign;
    return;
  }
  const bt_field* const payload = bt_event_borrow_payload_field_const(event);
  const auto type = static_cast<uint64_t>(integerOf(layout.type.of(payload)));
  const bt_field* const function_field = layout.function.of(payload);
  const auto number = static_cast<uint64_t>(integerOf(function_field));
  ThreadState& state = of_stream_ != nullptr ? *of_stream_ : stateOf(layout, event);
  Function& function = functionOf(number, function_field);
  state.last = std::max(state.last, time);

  switch (type) {
    case trace::kEntry33:
    case trace::kEntry43:
      enter(state, function, time);
      break;
    case trace::kExit33:
    case trace::kExit43:
    case trace::kErrorExit33:
    case trace::kErrorExit43:
      leave(state, function, time,
            layout.code ? std::optional(integerOf(layout.code.of(payload))) : std::nullopt);
      break;
    case trace::kDebug:
    case trace::kDebugError:
      if (layout.text) {
        if (!isVisible(time)) break;
        readText(layout.text.of(payload), text_);
        visitor_.message(
            {&state.thread, &function, time, state.visible, type == trace::kDebugError, text_});
        break;
      }
      [[fallthrough]];
    default:
      ++reading.foreign;
      return;
  }
  if (time <= state.last_before) ++reading.again;
  if (++reading.records == next_progress_) {
    next_progress_ += kRecordsPerProgress;
    if (settings_.progress) {
      std::optional<double> part;
      if (order_ == Order::kByThread && packets_ <= expected_packets) {
        part = static_cast<double>(packets_) / static_cast<double>(expected_packets);
      }
      settings_.progress(reading.records, part);
    }
  }
}

void Reader::enter(ThreadState& state, Function& function, int64_t time) {
  Call call;
  call.thread = &state.thread;
  call.function = &function;
  call.begin = call.end = time;
  call.depth = state.visible;
  call.has_entry = true;
  state.stack.push_back({call, isVisible(time)});
  ++state.open[&function];
  if (!state.stack.back().is_visible) return;
  ++state.visible;
  visitor_.begin(state.stack.back().call);
}

void Reader::leave(ThreadState& state, Function& function, int64_t time,
                   std::optional<int64_t> code) {
  if (!state.open.contains(&function)) {
    if (!isVisible(time)) return;
    Call call;
    call.thread = &state.thread;
    call.function = &function;
    call.begin = call.end = time;
    call.depth = state.visible;
    call.has_exit = true;
    call.code = code;
    call.failed = failedOf(function.recorded, code);
    visitor_.end(call);
    return;
  }
  while (state.stack.back().call.function != &function) leaveUnfinished(state, time);
  Call& call = state.stack.back().call;
  call.end = std::max(time, call.begin);
  call.has_exit = true;
  call.code = code;
  call.failed = failedOf(function.recorded, code);
  endTop(state);
}

void Reader::leaveUnfinished(ThreadState& state, int64_t time) {
  Call& call = state.stack.back().call;
  call.end = std::max(time, call.begin);
  endTop(state);
}

void Reader::endTop(ThreadState& state) {
  const OpenCall top = state.stack.back();
  state.stack.pop_back();
  const auto open = state.open.find(top.call.function);
  if (--open->second == 0) state.open.erase(open);
  if (!state.stack.empty()) state.stack.back().call.children += top.call.total();
  if (!top.is_visible) return;
  --state.visible;
  visitor_.end(top.call);
}

void Reader::endThread(ThreadState& state) {
  while (!state.stack.empty()) leaveUnfinished(state, state.last);
  state.stack.shrink_to_fit();
}

void Reader::finish() {
  for (const auto& [id, state] : threads_by_id_) endThread(*state);
}

Function& Reader::functionOf(uint64_t number, const bt_field* field) {
  Function*& function = functions_by_number_[number];
  if (function != nullptr) return *function;
  // A message has the level in the low byte.
  const uint64_t without_level = number & ~trace::kLevelByte;
  if (number != without_level && !settings_.names.contains(number) &&
      (settings_.names.contains(without_level) || knownFunction(without_level) != nullptr)) {
    Function& same = functionOf(without_level, field);
    return *(functions_by_number_[number] = &same);
  }
  Function made;
  made.index = functions_.size();
  if (const Known* const known = knownFunction(number)) {
    made.name = known->name;
    made.recorded = known->recorded;
  }
  const auto named = settings_.names.find(number);
  if (named != settings_.names.end()) made.name = named->second;
  if (made.name.empty() && bt_field_class_type_is(bt_field_get_class_type(field),
                                                  BT_FIELD_CLASS_TYPE_UNSIGNED_ENUMERATION)) {
    bt_field_class_enumeration_mapping_label_array labels = nullptr;
    uint64_t count = 0;
    if (bt_field_enumeration_unsigned_get_mapping_labels(field, &labels, &count) ==
            BT_FIELD_ENUMERATION_GET_MAPPING_LABELS_STATUS_OK &&
        count > 0) {
      made.name = labels[0];
    }
  }
  if (made.name.empty()) {
    char hexadecimal[2 + 16 + 1];
    (void)snprintf(hexadecimal, sizeof hexadecimal, "0x%" PRIx64, number);
    made.name = hexadecimal;
  }
  function = &functions_.emplace_back(std::move(made));
  return *function;
}

// The thread of a record whose stream has those of several.
ThreadState& Reader::stateOf(const Layout& layout, const bt_event* event) {
  const bt_field* const common = bt_event_borrow_common_context_field_const(event);
  const bt_field* const specific = bt_event_borrow_specific_context_field_const(event);
  const auto find = [&](Member Owner::*member) -> const bt_field* {
    if (layout.specific.*member) return (layout.specific.*member).of(specific);
    if (layout.common.*member) return (layout.common.*member).of(common);
    return nullptr;
  };
  const bt_trace* const trace = bt_stream_borrow_trace_const(bt_event_borrow_stream_const(event));
  const bt_field* const process = find(&Owner::process);
  const bt_field* thread = find(&Owner::thread);
  if (thread == nullptr && layout.packet) {
    thread =
        layout.packet.of(bt_packet_borrow_context_field_const(bt_event_borrow_packet_const(event)));
  }
  const int64_t process_id = process != nullptr ? integerOf(process) : 0;
  const int64_t thread_id = thread != nullptr ? integerOf(thread) : 0;

  Uuid uuid{};
  if (const bt_uuid bytes = bt_trace_get_uuid(trace)) std::copy_n(bytes, uuid.size(), uuid.begin());
  ThreadState*& state = threads_by_id_[{uuid, process_id, thread_id}];
  if (state == nullptr) {
    std::string name;
    const bt_field* const program = find(&Owner::program);
    if (program != nullptr) readText(program, name);
    name.erase(std::min(name.find('\0'), name.size()));
    state = &addThread(processOf(trace, program != nullptr ? &name : nullptr,
                                 process != nullptr ? &process_id : nullptr),
                       static_cast<uint64_t>(thread_id));
  }
  return *state;
}

// What the record does not say is in the trace's environment.
const Process* Reader::processOf(const bt_trace* trace, const std::string* program,
                                 const int64_t* id) {
  Process process;
  const auto textOf = [trace](const char* name) -> std::string {
    const bt_value* const value =
        bt_trace_borrow_environment_entry_value_by_name_const(trace, name);
    return value != nullptr && bt_value_is_string(value) ? bt_value_string_get(value) : "";
  };
  process.host = textOf("hostname");
  process.program = program != nullptr ? *program : textOf("procname");
  if (id != nullptr) {
    process.id = *id;
  } else if (const bt_value* const value =
                 bt_trace_borrow_environment_entry_value_by_name_const(trace, "vpid")) {
    if (bt_value_is_signed_integer(value)) process.id = bt_value_integer_signed_get(value);
  }
  return &processes_.try_emplace({process.host, process.program, process.id}, process)
              .first->second;
}

void Reader::addUnreadable(const std::string& why) {
  ++reading.unreadable;
  if (reading.problems.size() < kMostProblems)
    reading.problems.push_back(current_->path + ": " + why);
}

}  // namespace

Reading read(const std::vector<std::string>& paths, const Settings& settings, Visitor& visitor) {
  const auto reader = std::make_shared<Reader>(settings, visitor);
  Folders folders = findFolders(paths);
  reader->reading.unreadable = folders.problems.size();
  reader->reading.problems = std::move(folders.problems);
  for (const Folder& folder : folders.folders) reader->expected_packets += folder.files.size();
  reader->readFolders(folders.folders);
  reader->finish();
  Reading reading = std::move(reader->reading);
  reading.kept = reader;
  return reading;
}

}  // namespace traces
