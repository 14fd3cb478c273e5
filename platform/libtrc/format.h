// The layout of the trace files. metadata.cpp describes the same layout to the readers.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <array>
#include <atomic>
#include <bit>

namespace trc {

static_assert(std::endian::native == std::endian::little,
              "the packed word of a record's header and the metadata say little-endian");

using Uuid = std::array<uint8_t, 16>;

constexpr uint32_t kPacketMagic = 0xC1FC1FC1;

// The start of every packet. A stream's first file begins with an empty packet, and each file has one with
// records; recorder.h says what is different in a trace that keeps the latest records. Sizes are in bits. The content size comes before the end time: a reader that reads a growing file
// in this order gets an end time that is no earlier than the last record within that size.
struct Packet {
  uint32_t magic;
  Uuid trace_uuid;
  uint32_t stream_id;
  uint64_t stream_instance_id;  // all files of one thread have the same
  uint64_t content_size;
  uint64_t packet_size;
  uint64_t timestamp_begin;
  uint64_t timestamp_end;
  uint64_t events_discarded;  // from the stream's beginning to the end of this packet
  uint64_t tid;
};
static_assert(sizeof(Packet) == 80);

// The start of every packet of a trace that keeps the latest records.
struct NumberedPacket {
  Packet packet;
  uint64_t number;  // within the stream: where numbers are missing, packets were overwritten
};
static_assert(sizeof(NumberedPacket) == 88);

// A record begins at a multiple of 8 bytes. Nearly all are small: two words of bit fields, from the lowest
// bit on. Fewer bytes need fewer pages, which cost the most time after the clock.
//
//   bits 0-2     3-58   59-84   85-116     117-127
//        layout  time   type    function   object
//        layout  time   type    function   object (117), code (118-127, signed)     kReturn
//        layout  time   -       type (64-89), function (90-121), object (122-127)   kMessage
//
// kMessage leaves a gap because readers require the text, and the fields in the same struct, to begin at a
// whole byte; 4 bytes of length and the text follow. In small records the object's bits are all 0.
//
// A record whose values do not fit has the wide layout: the first word with layout and time only, then
// type, function and object in 8 bytes each, then the 8-byte code, or the length and the text.
constexpr size_t kRecordAlignment = 8;
constexpr unsigned kLayoutBits = 3;
constexpr unsigned kTimeBits = 56;
// A small record has the low bits of the time; readers take the rest from timestamp_begin.
constexpr uint64_t kTimeMask = (uint64_t{1} << kTimeBits) - 1;
constexpr unsigned kTypeBits = 26;
constexpr unsigned kFunctionBits = 32;
constexpr unsigned kObjectBits = 1;
constexpr unsigned kCodeBits = 10;
constexpr unsigned kMessageObjectBits = 64 - kTypeBits - kFunctionBits;
static_assert(kLayoutBits + kTimeBits + kTypeBits + kFunctionBits + kObjectBits + kCodeBits == 128);
constexpr size_t kSmallBytes = 16;
constexpr size_t kWideBytes = 32;

enum Layout : uint64_t {
  kRecord = 0,   // without data
  kReturn = 1,   // with a code
  kMessage = 2,  // with a text
  kWide = 4,     // added to one of these
};

// Makes a number in a mapped file visible to readers after everything that was written before it.
template <typename Number>
void publish(Number& where, Number value) {
  std::atomic_ref<Number>(where).store(value, std::memory_order_release);
}

constexpr uint64_t roundUp(uint64_t value, uint64_t unit) {
  return (value + unit - 1) / unit * unit;
}

}  // namespace trc
