// Reads trace files bit by bit, without the sources or the metadata of the library.
#pragma once

#include <gtest/gtest.h>
#include <stdint.h>
#include <string.h>

#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "test_libtrc.h"
#include "world.h"

namespace files {

struct Record {
  uint64_t layout = 0;
  uint64_t time = 0;
  uint64_t type = 0;
  uint64_t function = 0;
  uint64_t object = 0;
  std::optional<int64_t> code;
  std::optional<std::string> text;

  bool operator==(const Record&) const = default;
};

inline void PrintTo(const Record& record, std::ostream* out) {
  *out << std::hex << "layout " << record.layout << " type " << record.type << " function "
       << record.function << " object " << record.object << std::dec << " time " << record.time;
  if (record.code) *out << " code " << *record.code;
  if (record.text) *out << " text of " << record.text->size() << " " << record.text->substr(0, 40);
}

struct Packet {
  std::string uuid;
  uint64_t stream_id = 0;
  uint64_t instance = 0;
  uint64_t content_bits = 0;
  uint64_t packet_bits = 0;
  uint64_t begin = 0;
  uint64_t end = 0;
  uint64_t discarded = 0;
  uint64_t tid = 0;
  uint64_t number = 0;  // only where the latest records are kept
  std::vector<Record> records;
};

class Bits {
 public:
  Bits(const std::string& bytes, size_t from) : bytes_(bytes), at_(from * 8) {}

  size_t at() const { return at_; }
  void align(size_t bits) {
    while (at_ % bits != 0) ++at_;
  }
  uint64_t take(unsigned count) {
    uint64_t value = 0;
    for (unsigned i = 0; i < count; ++i, ++at_) {
      const auto byte = static_cast<unsigned char>(bytes_.at(at_ / 8));
      if ((byte >> at_ % 8 & 1) != 0) value += uint64_t{1} << i;
    }
    return value;
  }
  int64_t takeSigned(unsigned count) {
    const uint64_t value = take(count);
    if (count == 64 || value >> (count - 1) == 0) return static_cast<int64_t>(value);
    return static_cast<int64_t>(value) - (int64_t{1} << count);
  }
  std::string takeBytes(size_t count) {
    EXPECT_EQ(at_ % 8, 0U);
    const size_t from = at_ / 8;
    at_ += count * 8;
    return bytes_.substr(from, count);
  }

 private:
  const std::string& bytes_;
  size_t at_;
};

constexpr uint64_t kFullTime = uint64_t{1} << 56;

inline Record takeRecord(Bits& bits, uint64_t& time) {
  Record record;
  record.layout = bits.take(3);
  const uint64_t low = bits.take(56);
  uint64_t full = time - time % kFullTime + low;
  if (full < time) full += kFullTime;
  time = full;
  record.time = time;
  const bool is_wide = record.layout >= 4;
  const uint64_t kind = record.layout % 4;
  EXPECT_LE(kind, 2U);
  if (is_wide) {
    bits.align(64);
    record.type = bits.take(64);
    record.function = bits.take(64);
    record.object = bits.take(64);
    if (kind == 1) record.code = bits.takeSigned(64);
  } else {
    if (kind == 2) bits.align(8);
    record.type = bits.take(26);
    record.function = bits.take(32);
    record.object = bits.take(kind == 0 ? 11 : kind == 1 ? 1 : 6);
    if (kind == 1) record.code = bits.takeSigned(10);
  }
  if (kind == 2) record.text = bits.takeBytes(bits.take(32));
  return record;
}

// The packets of a trace that keeps the latest records are numbered. Its files begin with an empty packet, too, which is
// larger.
inline bool isNumbered(const std::string& bytes) {
  uint64_t content_bits = 0;
  memcpy(&content_bits, bytes.data() + 32, sizeof content_bits);
  return content_bits == 88 * 8;
}

inline Packet takePacket(const std::string& bytes, size_t from) {
  Packet packet;
  Bits bits(bytes, from);
  EXPECT_EQ(bits.take(32), 0xC1FC1FC1U);
  packet.uuid = bits.takeBytes(16);
  packet.stream_id = bits.take(32);
  packet.instance = bits.take(64);
  packet.content_bits = bits.take(64);
  packet.packet_bits = bits.take(64);
  packet.begin = bits.take(64);
  packet.end = bits.take(64);
  packet.discarded = bits.take(64);
  packet.tid = bits.take(64);
  const bool is_numbered = isNumbered(bytes);
  if (is_numbered) packet.number = bits.take(64);
  const size_t end = from * 8 + packet.content_bits;
  uint64_t time = packet.begin;
  while (bits.at() < end) {
    bits.align(64);
    packet.records.push_back(takeRecord(bits, time));
  }
  EXPECT_EQ(bits.at(), end);
  if (is_numbered) return packet;
  // The rest is reserved and zero.
  const size_t used = from + (packet.content_bits + 7) / 8;
  EXPECT_EQ(bytes.find_first_not_of('\0', used) < from + packet.packet_bits / 8, false);
  return packet;
}

struct File {
  uint64_t size = 0;
  std::vector<Packet> packets;
};

inline File readFile(const fs::path& path) {
  const std::string bytes = contentsOf(path);
  File file;
  file.size = bytes.size();
  for (size_t from = 0; from < bytes.size();) {
    file.packets.push_back(takePacket(bytes, from));
    from += file.packets.back().packet_bits / 8;
    EXPECT_LE(from, bytes.size());
    if (file.packets.back().packet_bits == 0) break;
  }
  return file;
}

// The name that babeltrace2 does not show: "stream-TID-STREAM-FILE".
inline std::string nameOf(uint64_t tid, uint64_t stream, uint64_t file) {
  return "stream-" + std::to_string(tid) + "-" + std::to_string(stream) + "-" +
         std::to_string(file);
}

// The files of a trace by name, without its metadata.
inline std::map<std::string, File> readTrace(const fs::path& directory) {
  std::map<std::string, File> found;
  for (const fs::path& path : entries(directory)) {
    if (path.filename() != "metadata") found[path.filename()] = readFile(path);
  }
  return found;
}

// The only trace below a directory.
inline fs::path onlyTrace(const std::string& root) {
  const std::vector<fs::path> traces = entries(root);
  EXPECT_EQ(traces.size(), 1U);
  return traces.at(0);
}

// All records of a thread's files in order.
inline std::vector<Record> recordsOf(const std::map<std::string, File>& trace, uint64_t tid,
                                     uint64_t stream) {
  std::vector<Record> records;
  for (uint64_t number = 0; trace.count(nameOf(tid, stream, number)) != 0; ++number) {
    for (const Packet& packet : trace.at(nameOf(tid, stream, number)).packets) {
      records.insert(records.end(), packet.records.begin(), packet.records.end());
    }
  }
  return records;
}

}  // namespace files
