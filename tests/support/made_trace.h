// Traces that a test writes itself, field by field, as libtrc does in another form.
#pragma once

#include <stdint.h>
#include <string.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "trace_numbers.h"

constexpr uint64_t kCopyFile = trace::functionId(6, 7);        // records a success flag
constexpr uint64_t kIsDirectory = trace::functionId(6, 3);     // yes or no
constexpr uint64_t kCheckFilePerms = trace::functionId(6, 6);  // a code
constexpr uint64_t kGetTempDir = trace::functionId(3, 1);      // nothing
constexpr uint64_t kOwn = 0x12340000;                          // a function of a program

constexpr uint64_t kSecond = 1'000'000'000;
constexpr uint64_t kBegin = 1'700'000'000 * kSecond;

constexpr const char kMadeMetadata[] = R"(/* CTF 1.8 */
typealias integer { size = 32; align = 8; } := number32;
typealias integer { size = 64; align = 8; } := number64;
typealias integer { size = 64; align = 8; signed = true; } := signed64;
trace {
  major = 1; minor = 8; byte_order = le;
  packet.header := struct { number32 magic; number32 stream_id; number64 stream_instance_id; };
};
env { hostname = "host"; procname = "program"; vpid = 7; };
clock { name = real; freq = 1000000000; offset = 0; absolute = true; };
typealias integer { size = 64; align = 8; map = clock.real.value; } := time64;
stream {
  id = 0;
  packet.context := struct {
    number64 content_size; number64 packet_size; time64 timestamp_begin; time64 timestamp_end;
    number64 events_discarded; number64 tid;
  };
  event.header := struct { number32 id; time64 timestamp; };
};
event {
  name = "record"; id = 0; stream_id = 0;
  fields := struct { number64 type; number64 function; number64 object; };
};
event {
  name = "return"; id = 1; stream_id = 0;
  fields := struct { number64 type; number64 function; number64 object; signed64 code; };
};
event {
  name = "message"; id = 2; stream_id = 0;
  fields := struct {
    number64 type; number64 function; number64 object; number32 length;
    integer { size = 8; align = 8; encoding = UTF8; } text[length];
  };
};
event { name = "other"; id = 3; stream_id = 0; fields := struct { number64 number; }; };
)";

// One thread's stream, of one packet unless a test ends packets.
class MadeStream {
 public:
  explicit MadeStream(uint64_t thread) : thread_(thread) {}

  MadeStream& enter(uint64_t time, uint64_t function) {
    return event(0, time, {trace::kEntry33, function, 0});
  }
  MadeStream& leave(uint64_t time, uint64_t function, std::optional<int64_t> code = 0) {
    if (!code) return event(0, time, {trace::kExit33, function, 0});
    const uint64_t type = *code == 0 ? trace::kExit33 : trace::kErrorExit33;
    return event(1, time, {type, function, 0, static_cast<uint64_t>(*code)});
  }
  MadeStream& message(uint64_t time, uint64_t function, std::string_view text,
                      uint64_t type = trace::kDebug) {
    event(2, time, {type, function, 0});
    add(static_cast<uint32_t>(text.size()));
    events_ += text;
    return *this;
  }
  // For metadata whose text is a string.
  MadeStream& string(uint64_t time, uint64_t function, std::string_view text, uint64_t type) {
    event(2, time, {type, function, 0});
    events_ += text;
    events_ += '\0';
    return *this;
  }
  MadeStream& other(uint64_t time) { return event(3, time, {1}); }
  MadeStream& discard(uint64_t records) {
    discarded_ += records;
    return *this;
  }

  MadeStream& endPacket() {
    if (packets_.empty()) packets_ = packet("", 0);
    packets_ += packet(events_, discarded_);
    events_.clear();
    first_ = 0;
    return *this;
  }

  // An empty packet, and those with the events and the number of discarded records.
  std::string file() const {
    return (packets_.empty() ? packet("", 0) : packets_) + packet(events_, discarded_);
  }

 private:
  template <typename Number>
  static void addTo(std::string& bytes, Number number) {
    char copy[sizeof number];
    memcpy(copy, &number, sizeof number);
    bytes.append(copy, sizeof copy);
  }
  template <typename Number>
  void add(Number number) {
    addTo(events_, number);
  }

  MadeStream& event(uint32_t id, uint64_t time, const std::vector<uint64_t>& fields) {
    add(id);
    add(time);
    for (const uint64_t field : fields) add(field);
    if (first_ == 0) first_ = time;
    last_ = time;
    return *this;
  }

  std::string packet(const std::string& events, uint64_t discarded) const {
    std::string bytes;
    addTo(bytes, uint32_t{0xC1FC1FC1});
    addTo(bytes, uint32_t{0});
    addTo(bytes, thread_);
    const uint64_t bits = (bytes.size() + 6 * sizeof(uint64_t) + events.size()) * 8;
    for (const uint64_t field :
         {bits, bits, first_, events.empty() ? first_ : last_, discarded, thread_}) {
      addTo(bytes, field);
    }
    return bytes + events;
  }

  uint64_t thread_;
  std::string packets_;  // those that have ended
  uint64_t first_ = 0;
  uint64_t last_ = 0;
  uint64_t discarded_ = 0;
  std::string events_;
};

// Makes the directory. Returns it.
inline std::string makeTrace(const std::string& directory, const std::vector<MadeStream>& streams,
                             std::string_view metadata = kMadeMetadata) {
  std::filesystem::create_directories(directory);
  std::ofstream(directory + "/metadata", std::ios::binary) << metadata;
  for (size_t i = 0; i < streams.size(); ++i) {
    std::ofstream(directory + "/stream-" + std::to_string(i), std::ios::binary)
        << streams[i].file();
  }
  return directory;
}
