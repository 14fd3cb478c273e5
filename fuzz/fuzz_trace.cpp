// Random records, written through libtrc and the trace frame and read back from the files.
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "ctf_reader.h"
#include "fuzz.h"
#include "input.h"
#include "ldtr.h"
#include "platform.h"

namespace {

namespace fs = std::filesystem;

constexpr int kMaxSteps = 64;
constexpr int kMaxLimitedRuns = 20'000;  // each takes memory that is never freed
constexpr size_t kPage = 4096;
constexpr size_t kLongestText = 65'536;
constexpr size_t kFileBytes[] = {4 << 10, 64 << 10, 256 << 10, 1 << 20, 4 << 20};

constexpr std::array<uint64_t, 8> kTypes = {0x3200000, 0x32A0000, 0x3210000, 0x32B0000,
                                            0x30B0000, 0x30C0000, 0x3400000, 0x3070000};
constexpr std::array<uint64_t, 6> kIds = {0x3E040100,         0x3E0601FF, 0xC8010000,
                                          0x3EFFFFFF12345678, 0xFFFFFFFF, 0x100000000};

uint64_t now() {
  timespec time;
  clock_gettime(CLOCK_MONOTONIC, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000U + static_cast<uint64_t>(time.tv_nsec);
}

size_t roundedUp(size_t bytes, size_t unit) { return (bytes + unit - 1) / unit * unit; }

// What a reader has to find.
struct Record {
  std::string event;
  uint64_t type;
  uint64_t id;
  uint64_t object;
  int64_t code;
  std::string text;

  bool hasSmallNumbers() const {
    return object == 0 && type < (uint64_t{1} << 26) && id < (uint64_t{1} << 32);
  }
  size_t bytes() const {
    if (event == "message") return (hasSmallNumbers() ? 20 : 36) + text.size();
    if (event == "return") return hasSmallNumbers() && code >= -512 && code <= 511 ? 16 : 40;
    return hasSmallNumbers() ? 16 : 32;
  }
};

bool isExit(uint64_t type) {
  return type == 0x3210000 || type == 0x32B0000 || type == 0x30B0000 || type == 0x30C0000;
}

Record recordOf(uint64_t type, uint64_t id, const void* object, std::string_view data) {
  Record record{"record", type, id, reinterpret_cast<uint64_t>(object), 0, ""};
  if (data.size() == 8 && isExit(type)) {
    record.event = "return";
    memcpy(&record.code, data.data(), 8);
  } else if (!data.empty()) {
    record.event = "message";
    record.text = data.substr(0, kLongestText);
  }
  return record;
}

// Where the records of a thread have to be: a file for each size, until one does not fit.
class Layout {
 public:
  // Finds the place of the next record in its file. A new file takes its size from `left`, as much of it as there is.
  // Without room for the record, neither that nor any later one has a place.
  void add(const Record& record, size_t& left) {
    if (is_full_) return;
    if (sizes_.empty() || sizes_.back() - next_ < record.bytes()) {
      next_ = sizes_.empty() ? 160 : 80;
      const size_t needed = roundedUp(next_ + record.bytes(), kPage);
      const size_t usual = kFileBytes[std::min(sizes_.size(), std::size(kFileBytes) - 1)];
      is_full_ = needed > left;
      if (is_full_) return;
      sizes_.push_back(std::min(std::max(usual, needed), left));
      left -= sizes_.back();
    }
    places_.push_back(next_);
    next_ += roundedUp(record.bytes(), 8);
  }

  const std::vector<size_t>& places() const { return places_; }
  const std::vector<size_t>& sizes() const { return sizes_; }

 private:
  std::vector<size_t> places_;
  std::vector<size_t> sizes_;
  size_t next_ = 0;
  bool is_full_ = false;
};

// The records of one thread.
struct Stream {
  uint64_t tid;
  std::vector<Record> records;
  Layout layout;  // unless the trace keeps the latest records
};

// ---- Writing ----

class Writer {
 public:
  // `limit`: the bytes that all files may have together; SIZE_MAX: any number.
  Writer(Input& input, size_t limit)
      : input_(input), is_limited_(limit != SIZE_MAX), left_(limit) {}

  // In the order of their first records.
  const std::vector<Stream>& streams() const { return streams_; }
  // Whether a trace that keeps the latest records has some of this stream: the thread goes on, or nothing was written
  // after it.
  bool isLatest(size_t stream) const { return stream == own_ || stream == last_; }

  void write() {
    while (!isDone()) {
      if (input_.byte() % 16 == 15) {
        std::thread([this] {
          size_t stream = SIZE_MAX;
          const int steps = input_.byte() % 8;
          for (int i = 0; i < steps && !isDone(); ++i) step(stream);
        }).join();
      } else {
        step(own_);
      }
    }
  }

 private:
  bool isDone() const { return input_.isAtEnd() || steps_ == kMaxSteps; }

  void step(size_t& stream) {
    ++steps_;
    switch (input_.byte() % 8) {
      case 0:
        return writeRaw(stream);
      case 1:
        return writeLong(stream);
      case 2:
        return writeExit(stream);
      case 3:
        // With a limit it could begin tracing that has stopped again.
        if (!is_limited_) expectSame("trcInit during a trace", trcInit(), 0);
        return;
      case 4: {
        const uint64_t type = number(kTypes), id = number(kIds);
        const void* const about = object();
        ldtr_write(type, id, about);
        return expect(stream, recordOf(type, id, about, ""));
      }
      default:
        return writeText(stream);
    }
  }

  template <size_t Count>
  uint64_t number(const std::array<uint64_t, Count>& usual) {
    const uint8_t choice = input_.byte();
    return choice < 2 * Count ? usual[choice / 2] : input_.number<uint64_t>();
  }
  const void* object() {
    return input_.byte() % 4 != 3 ? nullptr
                                  : reinterpret_cast<const void*>(input_.number<uint64_t>());
  }

  void expect(size_t& stream, Record record) {
    if (stream == SIZE_MAX) {
      stream = streams_.size();
      streams_.push_back({static_cast<uint64_t>(gettid()), {}, {}});
    }
    last_ = stream;
    streams_[stream].layout.add(record, left_);
    streams_[stream].records.push_back(std::move(record));
  }

  void writeData(size_t& stream, const std::string& data) {
    const uint64_t type = number(kTypes), id = number(kIds);
    const void* const about = object();
    // Exactly as long as the data, so that the sanitizer reports what is read after them.
    const std::vector<char> exact(data.begin(), data.end());
    const bool is_null = data.empty() && input_.byte() % 2 == 0;
    const uint64_t length = is_null ? input_.byte() : exact.size();
    trcWriteRec(type, id, about, length, is_null ? nullptr : exact.data(), 0, 0, 0, 0);
    expect(stream, recordOf(type, id, about, data));
  }

  void writeRaw(size_t& stream) {
    std::string data = input_.text();
    if (input_.byte() % 2 == 0) {
      const auto code = input_.number<int64_t>();
      data.assign(reinterpret_cast<const char*>(&code), sizeof code);
    }
    writeData(stream, data);
  }

  void writeLong(size_t& stream) {
    writeData(stream, std::string(input_.number<uint16_t>() * size_t{2}, 'l') + input_.text());
  }

  void writeExit(size_t& stream) {
    const bool is_43 = input_.byte() % 2 == 0;
    const uint64_t id = number(kIds);
    const void* const about = object();
    const auto code = static_cast<long>(input_.byte() % 2 == 0 ? input_.number<int8_t>()
                                                               : input_.number<int64_t>());
    const uint64_t events = input_.number<uint32_t>();
    trcEvents = events;
    ldtr_exit_errcode(id, is_43 ? 43 : 33, is_43 ? 0x10000 : 0x1000, code, about);
    trcEvents = 0;
    const bool is_error = code != 0 && (events & (is_43 ? 0x20000 : 0x2000)) != 0;
    const uint64_t type =
        is_error ? (is_43 ? 0x30C0000 : 0x30B0000) : (is_43 ? 0x32B0000 : 0x3210000);
    expect(stream, recordOf(type, id, about, {reinterpret_cast<const char*>(&code), sizeof code}));
  }

  // Through the operations of both formatters.
  void writeText(size_t& stream) {
    const uint8_t operation = input_.byte() % 8;
    const uint64_t type = number(kTypes), id = number(kIds);
    const void* const about = object();
    const std::array<uint64_t, 4> levels = {0xC8010000, 0xC8110000, 0xC8, 0xFFFFFFFFFFFFFF07};
    const uint64_t level = levels[input_.byte() % 4];
    std::string text(input_.byte() % 4 == 3 ? input_.number<uint16_t>() % 9000 : 0, 't');
    text += input_.text();
    const char* const argument = text.c_str();

    // A text is printed into 8192 bytes.
    std::string printed = text.substr(0, 8191);
    if (text.size() > 8192) {
      printed = "Error - ldtr_write: Debug format error - buffer is 8192 bytes rc=" +
                std::to_string(text.size()) + "\n";
    }
    const uint64_t id_or_level = id | (level & 0xFF);
    const uint64_t level_type = level == 0xC8110000 ? (type & 0xFF000000) | 0x70000 : type;
    ldtr_formater_local local(id, type, about);
    ldtr_formater_global global(type);
    switch (operation) {
      case 0:
        local();
        return expect(stream, recordOf(type, id, about, ""));
      case 1:
        local("%s", argument);
        return expect(stream, recordOf(type, id, about, printed));
      case 2:
        local(level, "%s", argument);
        return expect(stream, recordOf(type, id_or_level, about, printed));
      case 3:
        local.new_delete(&local, "%s", argument);
        return expect(stream, recordOf(type, id, &local, printed));
      case 4:
        local.debug(level, "%s", argument);
        return expect(stream, recordOf(level_type, id_or_level, about, printed));
      case 5:
        global(id, "%s", argument);
        return expect(stream, recordOf(type, id, nullptr, printed));
      case 6:
        global.new_delete(id, about, "%s", argument);
        return expect(stream, recordOf(type, id, about, printed));
      default:
        global.debug(level, "%s", argument);
        return expect(stream, recordOf(level_type, level, nullptr, printed));
    }
  }

  Input& input_;
  bool is_limited_;
  size_t left_;
  int steps_ = 0;
  std::vector<Stream> streams_;
  size_t own_ = SIZE_MAX;   // the stream of the thread that goes on
  size_t last_ = SIZE_MAX;  // ... and that of the last record
};

// ---- Reading ----

void expectNumber(const std::string& what, uint64_t ours, uint64_t expected) {
  if (ours != expected) fail(what.c_str(), std::to_string(ours), std::to_string(expected));
}

void expectRecord(const ctf::Event& event, const Record& record) {
  expectSame("the event's name", event.name, record.event);
  expectNumber("the type", event.values["type"], record.type);
  expectNumber("the id", event.values["function"], record.id);
  expectNumber("the object", event.values["object"], record.object);
  if (record.event == "return") {
    expectNumber("the code", event.values["code"], static_cast<uint64_t>(record.code));
  }
  if (record.event == "message") expectSame("the text", event.values.texts.at("text"), record.text);
}

struct Run {
  uint64_t begin;
  uint64_t end;
};

// Compares the files of one stream, in order, with its records.
void expectStream(const std::vector<const ctf::File*>& files, const Stream& stream, const Run& run,
                  const std::string& uuid) {
  const std::vector<size_t>& places = stream.layout.places();
  size_t next = 0;
  uint64_t time = 0;
  uint64_t discarded = 0;
  for (size_t i = 0; i < files.size(); ++i) {
    const ctf::File& file = *files[i];
    expectNumber("the packets of a file", file.packets.size(), i == 0 ? 2 : 1);
    if (i == 0 && !file.packets.front().events.empty()) fail("the first packet", "events", "none");
    for (const ctf::Packet& packet : file.packets) {
      expectNumber("the thread", packet.context["tid"], stream.tid);
      expectSame("the trace's id", packet.header.texts.at("uuid"), uuid);
      const uint64_t begin = packet.context["timestamp_begin"];
      const uint64_t end = packet.context["timestamp_end"];
      if (begin < time || end < begin) fail("the times of a packet", "go back", "in order");
      for (const ctf::Event& event : packet.events) {
        if (next == places.size()) fail("the records", "more", std::to_string(next));
        expectRecord(event, stream.records[next]);
        expectNumber("the place of a record", event.offset, places[next]);
        if (event.time < time || event.time < begin || event.time > end)
          fail("the time of a record", std::to_string(event.time), "in order");
        if (event.time + 1000 < run.begin || event.time > run.end + 1000)
          fail("the time of a record", std::to_string(event.time), std::to_string(run.begin));
        time = event.time;
        ++next;
      }
      if (packet.context["events_discarded"] < discarded) fail("missing records", "fewer", "more");
      discarded = packet.context["events_discarded"];
    }
  }
  expectNumber("the records", next, places.size());
  expectNumber("missing records", discarded, stream.records.size() - next);
  std::vector<size_t> sizes;
  for (const ctf::File* const file : files) sizes.push_back(file->bytes);
  if (sizes != stream.layout.sizes())
    fail("the sizes of the files", "others", "4 KiB, 64 KiB ... as far as there is room");
}

std::string bytesOf(std::string uuid) {
  std::erase(uuid, '-');
  std::string bytes;
  for (size_t i = 0; i + 1 < uuid.size(); i += 2) {
    bytes += static_cast<char>(std::stoi(uuid.substr(i, 2), nullptr, 16));
  }
  return bytes;
}

// The number after the last dash but `dashes`.
uint64_t numberIn(const std::string& name, int dashes) {
  size_t end = name.size();
  for (; dashes > 0; --dashes) end = name.rfind('-', end - 1);
  const size_t begin = name.rfind('-', end - 1) + 1;
  return std::stoull(name.substr(begin, end - begin));
}

// Returns the size of all files.
size_t expectTrace(const ctf::Trace& trace, const std::vector<Stream>& streams, const Run& run) {
  expectSame("the process in the metadata", trace.metadata.env.values.at("vpid"),
             std::to_string(getpid()));
  expectSame("the program in the metadata", trace.metadata.env.values.at("procname"),
             program_invocation_short_name);
  const std::string uuid = bytesOf(trace.metadata.trace.values.at("uuid"));

  // By number of the stream; streams are numbered when their first record is written.
  std::map<uint64_t, std::map<uint64_t, const ctf::File*>> by_stream;
  size_t bytes = 0;
  for (const ctf::File& file : trace.files) {
    bytes += file.bytes;
    by_stream[numberIn(file.name, 1)][numberIn(file.name, 0)] = &file;
  }
  // Without room for its first record, a thread has no file.
  const auto has_files = [](const Stream& one) { return !one.layout.sizes().empty(); };
  auto stream = streams.begin();
  for (const auto& [instance, files] : by_stream) {
    std::vector<const ctf::File*> ordered;
    for (const auto& [number, file] : files) {
      expectNumber("the number of a file", number, ordered.size());
      expectSame("the name of a file", file->name,
                 "stream-" + std::to_string(file->packets.at(0).context["tid"]) + "-" +
                     std::to_string(instance) + "-" + std::to_string(number));
      for (const ctf::Packet& packet : file->packets)
        expectNumber("the number of the stream", packet.header["stream_instance_id"], instance);
      ordered.push_back(file);
    }
    stream = std::find_if(stream, streams.end(), has_files);
    if (stream == streams.end()) fail("the streams", "more", std::to_string(streams.size()));
    expectStream(ordered, *stream++, run, uuid);
  }
  if (std::any_of(stream, streams.end(), has_files))
    fail("the streams", "fewer", std::to_string(streams.size()));
  return bytes;
}

// Whether a record may need more than half of its thread's share. Two threads have half of the limit each.
bool mayBeLeftOut(const Record& record, size_t limit) {
  return roundedUp(record.bytes() + 176, kPage) > limit / 4;
}

bool isText(const ctf::Event& event, const std::string& text) {
  const auto found = event.values.texts.find("text");
  return found != event.values.texts.end() && found->second == text;
}

// Compares the packets of a stream that keeps its latest records, in the order of their numbers. They have the last
// records, without those that were too large. Returns whether there are any.
bool expectLatest(std::map<uint64_t, ctf::Packet>& packets, const Stream& stream, size_t limit) {
  uint64_t number = packets.begin()->first;
  uint64_t time = 0;
  uint64_t discarded = 0;
  std::vector<const ctf::Event*> events;
  for (auto& [packet_number, packet] : packets) {
    expectNumber("the number of a packet", packet_number, number++);
    expectNumber("the thread", packet.context["tid"], stream.tid);
    if (packet.context["timestamp_begin"] < time || packet.context["timestamp_end"] < time)
      fail("the times of a packet", "go back", "in order");
    for (const ctf::Event& event : packet.events) {
      if (event.time < time) fail("the time of a record", "goes back", "in order");
      time = event.time;
      events.push_back(&event);
    }
    if (packet.context["events_discarded"] < discarded) fail("missing records", "fewer", "more");
    discarded = packet.context["events_discarded"];
  }
  expectNumber("missing records", discarded, stream.records.size() - events.size());
  auto record = stream.records.rbegin();
  for (auto event = events.rbegin(); event != events.rend(); ++event, ++record) {
    // Two threads have half of the limit each.
    while (record != stream.records.rend() && mayBeLeftOut(*record, limit) &&
           !isText(**event, record->text)) {
      ++record;
    }
    if (record == stream.records.rend()) fail("the records", "more", "fewer");
    expectRecord(**event, *record);
  }
  return !events.empty();
}

// Returns the size of all files.
size_t expectLatestTrace(const ctf::Trace& trace, const Writer& writer, size_t limit) {
  const std::vector<Stream>& streams = writer.streams();
  size_t bytes = trace.hidden_bytes;
  std::map<uint64_t, std::map<uint64_t, ctf::Packet>> by_stream;
  for (const ctf::File& file : trace.files) {
    ctf::Packet opening = file.packets.at(0);
    const uint64_t instance = opening.header["stream_instance_id"];
    expectNumber("the number of the stream", numberIn(file.name, 1), instance);
    expectNumber("the number of the first packet", opening.context["packet_seq_num"], 0);
    if (!opening.events.empty()) fail("the first packet", "events", "none");
    if (file.packets.size() == 1) continue;  // a link to a blank file, which is hidden
    bytes += file.bytes;
    ctf::Packet packet = file.packets.at(1);
    by_stream[instance][packet.context["packet_seq_num"]] = packet;
  }
  std::set<uint64_t> with_records;
  for (auto& [instance, packets] : by_stream) {
    const uint64_t tid = packets.begin()->second.context["tid"];
    const auto stream = std::find_if(streams.begin(), streams.end(),
                                     [tid](const Stream& one) { return one.tid == tid; });
    if (stream == streams.end()) fail("the streams", "another", "those of the threads");
    if (expectLatest(packets, *stream, limit)) with_records.insert(tid);
  }
  for (size_t i = 0; i < streams.size(); ++i) {
    const auto may_be_left_out = [limit](const Record& record) {
      return mayBeLeftOut(record, limit);
    };
    const std::vector<Record>& records = streams[i].records;
    if (writer.isLatest(i) && !std::all_of(records.begin(), records.end(), may_be_left_out) &&
        !with_records.contains(streams[i].tid))
      fail("the records of a thread", "none", "the latest");
  }
  return bytes;
}

// ---- The directory of the traces ----

class Traces {
 public:
  Traces() {
    setenv("TRC_DIR", traces_.c_str(), 1);
    unsetenv("TRC_EVENTS");
    unsetenv("PRINT_DEBUG");
  }

  // Removes the traces and begins a new one. `limit` is the bytes that the process may write into
  // files from now on; SIZE_MAX: any number.
  void begin(size_t limit, bool keeps_latest) {
    fs::remove_all(traces_);
    if (keeps_latest) {
      setenv("TRC_MODE", "latest", 1);
    } else {
      unsetenv("TRC_MODE");
    }
    if (limit != SIZE_MAX) {
      setenv("TRC_MAX_BYTES", std::to_string(written_ + limit).c_str(), 1);
    } else {
      unsetenv("TRC_MAX_BYTES");
    }
    expectSame("trcInit", trcInit(), 0);
  }

  ctf::Trace read(bool may_hide_files) const {
    const std::vector<fs::directory_entry> entries(fs::directory_iterator(traces_), {});
    if (entries.size() != 1) fail("traces", std::to_string(entries.size()), "1");
    try {
      return ctf::read(entries[0], may_hide_files);
    } catch (const std::exception& error) {
      fail("reading the trace", error.what(), "a valid trace");
    }
  }

  void addWritten(size_t bytes) { written_ += bytes; }

 private:
  Folder folder_;
  std::string traces_ = folder_.path("traces");
  size_t written_ = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Traces traces;
  static int limited_runs = 0;
  Input input(data, size);
  const uint8_t pages = input.byte();
  const bool is_limited = pages != 0 && pages < 64 && limited_runs < kMaxLimitedRuns;
  const bool keeps_latest = is_limited && pages >= 32;
  const size_t limit = !is_limited    ? SIZE_MAX
                       : keeps_latest ? (pages - 31) * size_t{4} * kPage
                                      : pages * kPage;
  if (is_limited) ++limited_runs;

  traces.begin(limit, keeps_latest);
  Run run{.begin = now(), .end = 0};
  Writer writer(input, limit);
  writer.write();
  run.end = now();

  const ctf::Trace trace = traces.read(keeps_latest);
  const size_t bytes = keeps_latest ? expectLatestTrace(trace, writer, limit)
                                    : expectTrace(trace, writer.streams(), run);
  if (bytes > limit) fail("the size of all files", std::to_string(bytes), std::to_string(limit));
  traces.addWritten(bytes);
  return 0;
}
