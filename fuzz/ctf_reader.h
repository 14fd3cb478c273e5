// Reads a trace in the Common Trace Format. What the files look like is taken from their metadata
// alone, as other readers do.
#pragma once

#include <stdint.h>
#include <string.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace ctf {

struct Error : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Field;

// An integer, an array of integers or a structure.
struct Type {
  unsigned size = 0;  // bits of an integer; 0: a structure
  unsigned align = 1;
  bool is_signed = false;
  bool is_clock = false;
  std::vector<Field> fields;
};

struct Field {
  std::string name;
  Type type;
  std::string count;  // of an array: a number or the name of a field; else empty
};

// A block of the metadata: { key = value; key := type; }
struct Block {
  std::map<std::string, std::string> values;
  std::map<std::string, Type> types;
};

struct Metadata {
  Block trace;
  Block env;
  Block clock;
  Block stream;
  std::map<uint64_t, Block> events;
};

// The values of a structure. An array of integers is a text.
struct Values {
  std::map<std::string, uint64_t> numbers;
  std::map<std::string, std::string> texts;

  uint64_t operator[](const std::string& name) const {
    const auto found = numbers.find(name);
    if (found == numbers.end()) throw Error("no field " + name);
    return found->second;
  }
};

struct Event {
  std::string name;
  uint64_t time;
  size_t offset;  // in the file, in bytes
  Values values;
};

struct Packet {
  Values header;
  Values context;
  std::vector<Event> events;
};

struct File {
  std::string name;
  size_t bytes;
  std::vector<Packet> packets;
};

class MetadataParser {
 public:
  explicit MetadataParser(std::string text) : text_(std::move(text)) { next(); }

  Metadata parse() {
    Metadata metadata;
    while (!token_.empty()) {
      const std::string keyword = take();
      if (keyword == "typealias") {
        Type type = takeType();
        expect(":=");
        aliases_[take()] = std::move(type);
      } else if (keyword == "trace") {
        metadata.trace = takeBlock();
      } else if (keyword == "env") {
        metadata.env = takeBlock();
      } else if (keyword == "clock") {
        metadata.clock = takeBlock();
      } else if (keyword == "stream") {
        metadata.stream = takeBlock();
      } else if (keyword == "event") {
        const Block event = takeBlock();
        if (!metadata.events.emplace(numberFrom(event.values.at("id")), event).second)
          throw Error("two events have the same id");
      } else {
        throw Error("unknown declaration " + keyword);
      }
      expect(";");
    }
    return metadata;
  }

  static uint64_t numberFrom(const std::string& text) {
    size_t end = 0;
    const uint64_t number = std::stoull(text, &end, 0);
    if (end != text.size()) throw Error("not a number: " + text);
    return number;
  }

 private:
  // Sets token_ to the next token, empty at the end. A text keeps its opening quote.
  void next() {
    constexpr std::string_view kInWord =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_.-";
    while (true) {
      at_ = std::min(text_.find_first_not_of(" \n", at_), text_.size());
      if (text_.compare(at_, 2, "/*") != 0) break;
      at_ = text_.find("*/", at_) + 2;
    }
    size_t length = std::min<size_t>(1, text_.size() - at_);
    if (text_.compare(at_, 2, ":=") == 0) {
      length = 2;
    } else if (text_.compare(at_, 3, "...") == 0) {
      length = 3;
    } else if (text_[at_] == '"') {
      length = text_.find('"', at_ + 1) - at_;
      token_ = text_.substr(at_, length);
      at_ += length + 1;
      return;
    } else if (kInWord.find(text_[at_]) != std::string_view::npos) {
      length = std::min(text_.find_first_not_of(kInWord, at_), text_.size()) - at_;
    }
    token_ = text_.substr(at_, length);
    at_ += length;
  }
  std::string take() {
    if (token_.empty()) throw Error("the metadata ends too early");
    std::string taken = token_;
    next();
    return taken;
  }
  bool takeIf(const char* token) {
    if (token_ != token) return false;
    next();
    return true;
  }
  void expect(const char* token) {
    if (!takeIf(token)) throw Error(std::string("expected ") + token + ", not " + token_);
  }

  Block takeBlock() {
    Block block;
    expect("{");
    while (!takeIf("}")) {
      const std::string key = take();
      if (takeIf(":=")) {
        block.types[key] = takeType();
      } else {
        expect("=");
        const std::string value = take();
        block.values[key] = value.front() == '"' ? value.substr(1) : value;
      }
      expect(";");
    }
    return block;
  }

  Type takeType() {
    const std::string keyword = take();
    if (keyword == "integer") return takeInteger();
    if (keyword == "struct") return takeStruct();
    if (keyword == "enum") {
      expect(":");
      Type type = takeType();
      skipNames();
      return type;
    }
    const auto alias = aliases_.find(keyword);
    if (alias == aliases_.end()) throw Error("unknown type " + keyword);
    return alias->second;
  }

  Type takeInteger() {
    const Block block = takeBlock();
    Type type;
    for (const auto& [key, value] : block.values) {
      if (key == "size")
        type.size = static_cast<unsigned>(numberFrom(value));
      else if (key == "align")
        type.align = static_cast<unsigned>(numberFrom(value));
      else if (key == "signed")
        type.is_signed = value == "true";
      else if (key == "map")
        type.is_clock = value == "clock.monotonic.value";
      else if (key != "base" && key != "encoding")
        throw Error("unknown attribute " + key);
    }
    if (type.size == 0 || type.size > 64 || type.align == 0) throw Error("a bad integer");
    return type;
  }

  Type takeStruct() {
    Type type;
    expect("{");
    while (!takeIf("}")) {
      const Type of_fields = takeType();
      do {
        Field field{take(), of_fields, ""};
        if (takeIf("[")) {
          field.count = take();
          expect("]");
        }
        type.align = std::max(type.align, of_fields.align);
        type.fields.push_back(field);
      } while (takeIf(","));
      expect(";");
    }
    return type;
  }

  void skipNames() {
    expect("{");
    while (!takeIf("}")) {
      const std::string name = take();
      expect("=");
      const uint64_t first = numberFrom(take());
      const uint64_t last = takeIf("...") ? numberFrom(take()) : first;
      if (last < first) throw Error("a bad range of " + name);
      (void)takeIf(",");
    }
  }

  std::string text_;
  size_t at_ = 0;
  std::string token_;
  std::map<std::string, Type> aliases_;
};

// Reads fields of any width, from the lowest bit on. Positions are in bits.
class BitReader {
 public:
  BitReader(std::string_view bytes, uint64_t limit) : bytes_(bytes), limit_(limit) {}

  uint64_t at() const { return at_; }
  void limitTo(uint64_t bits) {
    if (bits > bytes_.size() * 8) throw Error("a packet is larger than its file");
    limit_ = bits;
  }
  void align(unsigned to) { at_ = (at_ + to - 1) / to * to; }

  uint64_t number(const Type& type) {
    align(type.align);
    if (at_ + type.size > limit_) throw Error("a field goes beyond its packet");
    uint64_t value = 0;
    for (unsigned bit = 0; bit < type.size;) {
      const unsigned from = at_ % 8;
      const unsigned count = std::min(8 - from, type.size - bit);
      const uint64_t piece = (static_cast<uint8_t>(bytes_[at_ / 8]) >> from) & ((1U << count) - 1);
      value |= piece << bit;
      bit += count;
      at_ += count;
    }
    if (type.is_signed && type.size < 64 && (value >> (type.size - 1)) != 0)
      value |= ~uint64_t{0} << type.size;
    return value;
  }

  Values structure(const Type& type) {
    Values values;
    align(type.align);
    for (const Field& field : type.fields) {
      if (field.count.empty()) {
        values.numbers[field.name] = number(field.type);
      } else {
        const bool is_number = field.count.find_first_not_of("0123456789") == std::string::npos;
        uint64_t count = is_number ? std::stoull(field.count) : values[field.count];
        if (field.type.size != 8) throw Error("only arrays of bytes are known");
        align(field.type.align);
        if (at_ % 8 != 0 || count > (limit_ - at_) / 8)
          throw Error("a text goes beyond its packet");
        values.texts[field.name] = bytes_.substr(at_ / 8, count);
        at_ += count * 8;
      }
    }
    return values;
  }

 private:
  std::string_view bytes_;
  uint64_t limit_;
  uint64_t at_ = 0;
};

inline std::string contentsOfFile(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) throw Error("cannot read " + path.string());
  return {std::istreambuf_iterator<char>(file), {}};
}

inline Packet packetFrom(const Metadata& metadata, std::string_view bytes, size_t offset) {
  Packet packet;
  BitReader reader(bytes, bytes.size() * 8);
  packet.header = reader.structure(metadata.trace.types.at("packet.header"));
  packet.context = reader.structure(metadata.stream.types.at("packet.context"));
  if (packet.header["magic"] != 0xC1FC1FC1) throw Error("a packet without its magic number");
  if (packet.header["stream_id"] != std::stoull(metadata.stream.values.at("id")))
    throw Error("a packet of an unknown stream");
  const uint64_t content = packet.context["content_size"];
  if (content > packet.context["packet_size"]) throw Error("a packet is smaller than its content");
  reader.limitTo(content);

  const Type& header = metadata.stream.types.at("event.header");
  uint64_t clock = packet.context["timestamp_begin"];
  while (reader.at() < content) {
    Event event;
    reader.align(header.align);
    for (const Field& field : header.fields) reader.align(field.type.align);
    event.offset = offset + reader.at() / 8;
    const Values values = reader.structure(header);
    // The event has the low bits of its time; it is not before the one before it.
    for (const Field& field : header.fields) {
      if (!field.type.is_clock) continue;
      const uint64_t low = values[field.name];
      if (field.type.size < 64) {
        const uint64_t mask = (uint64_t{1} << field.type.size) - 1;
        const uint64_t before = clock;
        clock = (before & ~mask) | low;
        if (clock < before) clock += mask + 1;
      } else {
        clock = low;
      }
    }
    event.time = clock;
    const auto found = metadata.events.find(values["id"]);
    if (found == metadata.events.end()) throw Error("an event of an unknown id");
    event.name = found->second.values.at("name");
    event.values = reader.structure(found->second.types.at("fields"));
    packet.events.push_back(std::move(event));
  }
  return packet;
}

struct Trace {
  Metadata metadata;
  std::vector<File> files;  // in the order of their names
  size_t hidden_bytes = 0;
};

// Throws Error, or what std::map::at() throws, for a trace that is not valid. Hidden files are an error, unless they
// are expected: then only their pages are counted.
inline Trace read(const std::filesystem::path& directory, bool may_hide_files = false) {
  Trace trace;
  trace.metadata = MetadataParser(contentsOfFile(directory / "metadata")).parse();
  for (const auto& entry : std::filesystem::directory_iterator(directory)) {
    const std::string name = entry.path().filename();
    if (name == "metadata") continue;
    if (name.starts_with('.')) {
      if (!may_hide_files) throw Error("a file was left: " + name);
      struct stat status;
      if (stat(entry.path().c_str(), &status) != 0) throw Error("no such file: " + name);
      // The file without records is nearly all a hole.
      const auto size =
          static_cast<size_t>(name.starts_with(".blank") ? status.st_blocks * 512 : status.st_size);
      trace.hidden_bytes += (size + 4095) / 4096 * 4096;
      continue;
    }
    const std::string bytes = contentsOfFile(entry.path());
    File file{name, bytes.size(), {}};
    for (size_t at = 0; at < bytes.size();) {
      file.packets.push_back(packetFrom(trace.metadata, std::string_view(bytes).substr(at), at));
      const uint64_t size = file.packets.back().context["packet_size"];
      if (size == 0 || size % 8 != 0 || size / 8 > bytes.size() - at)
        throw Error("a bad packet size");
      at += size / 8;
    }
    trace.files.push_back(std::move(file));
  }
  return trace;
}

}  // namespace ctf
