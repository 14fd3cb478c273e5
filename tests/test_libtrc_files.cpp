// What is in the files of a trace, to the bit.
#include "test_libtrc_files.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::SizeIs;

namespace {

constexpr uint64_t kExitTypes[] = {0x3210000, 0x32B0000, 0x30B0000, 0x30C0000};
constexpr uint64_t kUsualSizes[] = {4096, 65536, 262144, 1048576, 4194304};
constexpr uint64_t kPacketBytes = 80;

struct Request {
  uint64_t type;
  uint64_t id;
  uint64_t object;
  std::string data;
  bool has_data;
};

void request(const Request& r) {
  trcWriteRec(r.type, r.id, reinterpret_cast<const void*>(r.object), r.data.size(),
              r.has_data ? r.data.data() : nullptr, 0, 0, 0, 0);
}

// A number of random width, near the limits of the fields more often than not.
uint64_t randomNumber(std::mt19937_64& random) {
  const uint64_t limits[] = {0, 1, 1U << 25, 1U << 26, 1U << 31, uint64_t{1} << 32, UINT64_MAX};
  if (random() % 2 == 0) return limits[random() % std::size(limits)] - random() % 2;
  return random() >> random() % 64;
}

std::string randomData(std::mt19937_64& random) {
  size_t length = random() % 30;
  if (random() % 20 == 0) length = random() % 20'000;
  if (random() % 200 == 0) length = 65'530 + random() % 12;
  std::string data(length, '\0');
  for (char& byte : data) byte = static_cast<char>(random());
  return data;
}

std::string dataOfCode(int64_t code) { return {reinterpret_cast<const char*>(&code), sizeof code}; }

int64_t randomCode(std::mt19937_64& random) {
  const int64_t limits[] = {0, 511, 512, -512, -513, INT64_MAX, INT64_MIN};
  if (random() % 2 == 0) return limits[random() % std::size(limits)];
  return static_cast<int64_t>(random()) >> random() % 64;
}

Request randomRequest(std::mt19937_64& random) {
  Request r{0x3200000, 0x3E060100, 0, "", false};
  if (random() % 2 == 0) r.type = randomNumber(random);
  if (random() % 2 == 0) r.id = randomNumber(random);
  if (random() % 4 == 0) r.object = randomNumber(random);
  switch (random() % 4) {
    case 0:
      break;
    case 1:
      r.data = randomData(random);
      r.has_data = random() % 8 != 0;
      break;
    case 2:
      r.type = kExitTypes[random() % std::size(kExitTypes)];
      r.data = random() % 8 != 0 ? dataOfCode(randomCode(random)) : randomData(random);
      r.has_data = random() % 8 != 0;
      break;
    default:
      r.data = dataOfCode(randomCode(random));  // in most cases not of an exit
      r.has_data = true;
  }
  return r;
}

// Which files a thread's records are in, according to docs/tracing.md.
class ExpectedStream {
 public:
  struct ExpectedFile {
    uint64_t size;
    uint64_t used;  // bytes
    uint64_t end_of_last;
    uint64_t begin;
    std::vector<files::Record> records;
  };

  void add(const Request& r, uint64_t time) {
    files::Record record{0, time, r.type, r.id, r.object, {}, {}};
    uint64_t bytes = 16;
    const bool is_exit =
        std::find(std::begin(kExitTypes), std::end(kExitTypes), r.type) != std::end(kExitTypes);
    bool is_wide = r.object != 0 || r.type >= 1U << 26 || r.id >= uint64_t{1} << 32;
    if (r.has_data && r.data.size() == 8 && is_exit) {
      int64_t code;
      memcpy(&code, r.data.data(), sizeof code);
      record.code = code;
      is_wide = is_wide || code < -512 || code > 511;
      record.layout = is_wide ? 5 : 1;
      bytes = is_wide ? 40 : 16;
    } else if (r.has_data && !r.data.empty()) {
      record.text = r.data.substr(0, 65'536);
      record.layout = is_wide ? 6 : 2;
      bytes = (is_wide ? 36 : 20) + record.text->size();
    } else {
      record.layout = is_wide ? 4 : 0;
      bytes = is_wide ? 32 : 16;
    }
    if (expected_.empty() || expected_.back().used + bytes > expected_.back().size) {
      const uint64_t header = expected_.empty() ? 2 * kPacketBytes : kPacketBytes;
      const uint64_t usual = kUsualSizes[std::min(expected_.size(), std::size(kUsualSizes) - 1)];
      const uint64_t needed = (header + bytes + 4095) / 4096 * 4096;
      expected_.push_back({std::max(usual, needed), header, 0, time, {}});
    }
    ExpectedFile& file = expected_.back();
    file.end_of_last = file.used + bytes;
    file.used = (file.end_of_last + 7) / 8 * 8;
    file.records.push_back(std::move(record));
  }

  void compare(const std::map<std::string, files::File>& found, uint64_t tid,
               uint64_t instance) const {
    for (size_t number = 0; number < expected_.size(); ++number) {
      SCOPED_TRACE(number);
      const std::string name = files::nameOf(tid, instance, number);
      ASSERT_EQ(found.count(name), 1U) << name;
      compare(found.at(name), expected_[number], number == 0, tid, instance);
    }
  }

  const std::vector<ExpectedFile>& files() const { return expected_; }

 private:
  static void compare(const files::File& found, const ExpectedFile& expected, bool is_first,
                      uint64_t tid, uint64_t instance) {
    EXPECT_EQ(found.size, expected.size);
    ASSERT_THAT(found.packets, SizeIs(is_first ? 2 : 1));
    for (const files::Packet& packet : found.packets) {
      EXPECT_EQ(packet.stream_id, 0U);
      EXPECT_EQ(packet.instance, instance);
      EXPECT_EQ(packet.tid, tid);
      EXPECT_EQ(packet.discarded, 0U);
    }
    uint64_t from = 0;
    if (is_first) {
      const files::Packet& empty = found.packets[0];
      EXPECT_EQ(empty.packet_bits, kPacketBytes * 8);
      EXPECT_EQ(empty.content_bits, kPacketBytes * 8);
      EXPECT_EQ(empty.begin, expected.begin - 1);
      EXPECT_EQ(empty.end, expected.begin - 1);
      from = kPacketBytes;
    }
    const files::Packet& packet = found.packets.back();
    EXPECT_EQ(packet.packet_bits, (expected.size - from) * 8);
    EXPECT_EQ(packet.content_bits, (expected.end_of_last - from) * 8);
    EXPECT_EQ(packet.begin, expected.begin);
    EXPECT_EQ(packet.end, expected.records.back().time);
    ASSERT_EQ(packet.records.size(), expected.records.size());
    for (size_t i = 0; i < packet.records.size(); ++i) {
      ASSERT_EQ(packet.records[i], expected.records[i]) << i;
    }
  }

  std::vector<ExpectedFile> expected_;
};

TEST(TrcFiles, HoldEveryBitOfManyRandomRecords) {
  for (const uint64_t seed : {1U, 2U, 3U}) {
    SCOPED_TRACE(seed);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                // The low bits of the time, all that a small record has, begin again soon.
                fake::useClock(files::kFullTime - 5'000'000);
                if (traceInto(temp.path("t")) != 0) return 1;
                std::mt19937_64 random(seed);
                ExpectedStream expected;
                const auto add = [&](const Request& r) {
                  if (random() % 4 != 0) fake::monotonic += random() >> (34 + random() % 30);
                  request(r);
                  expected.add(r, fake::monotonic);
                };
                // The first two files are full to the last byte.
                for (int i = 0; i < 246 + 4091; ++i)
                  add({i % 2 == 0 ? kEntry : kExit, 1, 0, "", false});
                for (int i = 0; i < 15'000 || expected.files().size() < 7; ++i)
                  add(randomRequest(random));
                EXPECT_EQ(expected.files()[0].used, 4096U);
                EXPECT_EQ(expected.files()[1].used, 65536U);
                const auto found = files::readTrace(files::onlyTrace(temp.path("t")));
                EXPECT_EQ(found.size(), expected.files().size());
                expected.compare(found, static_cast<uint64_t>(getpid()), 0);
                return 0;
              }),
              0);
  }
}

// ---- Their names, numbers and sizes ----

TEST(TrcFiles, AreNamedAfterTheirThreadItsStreamAndTheirOrder) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    std::vector<uint64_t> tids;
    for (int stream = 0; stream < 3; ++stream) {
      std::thread([&] {
        tids.push_back(static_cast<uint64_t>(gettid()));
        for (int i = 0; i < 300; ++i) record(kEntry, kDoesFileExist);
      }).join();
    }
    const auto found = files::readTrace(files::onlyTrace(temp.path("t")));
    EXPECT_THAT(found, SizeIs(6));
    std::string uuid =
        field(contentsOf(files::onlyTrace(temp.path("t")) / "metadata"), "uuid = \"", "\"");
    for (uint64_t stream = 0; stream < 3; ++stream) {
      for (uint64_t number = 0; number < 2; ++number) {
        const std::string name = files::nameOf(tids[stream], stream, number);
        ASSERT_EQ(found.count(name), 1U) << name;
        for (const files::Packet& packet : found.at(name).packets) {
          EXPECT_EQ(packet.tid, tids[stream]);
          EXPECT_EQ(packet.instance, stream);
          std::string shown;
          for (const char byte : packet.uuid) {
            char hex[3];
            (void)snprintf(hex, sizeof hex, "%02x", static_cast<unsigned char>(byte));
            shown += hex;
            if (shown.size() == 8 || shown.size() == 13 || shown.size() == 18 || shown.size() == 23)
              shown += '-';
          }
          EXPECT_EQ(shown, uuid);
        }
      }
    }
  });
}

void limitFileSizes(rlim_t bytes) {
  rlimit limit;
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &limit), 0);
  limit.rlim_cur = bytes;
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
}

std::vector<uint64_t> sizesOfFiles(const std::string& root, uint64_t tid, uint64_t stream = 0) {
  const auto found = files::readTrace(files::onlyTrace(root));
  std::vector<uint64_t> sizes;
  for (uint64_t number = 0; found.count(files::nameOf(tid, stream, number)) != 0; ++number) {
    sizes.push_back(found.at(files::nameOf(tid, stream, number)).size);
  }
  EXPECT_EQ(sizes.size(), found.size());
  return sizes;
}

TEST(TrcFiles, AreAsLargeAsTheirFirstRecordNeeds) {
  struct Case {
    std::vector<size_t> texts;
    std::vector<uint64_t> sizes;
  };
  const Case cases[] = {
      {{1}, {4096}},
      {{3916}, {4096}},
      {{3917}, {8192}},
      {{8012}, {8192}},
      {{8013}, {12288}},
      {{65'536}, {69'632}},
      {{3916, 1}, {4096, 65536}},
      {{3916, 65'436}, {4096, 65536}},
      {{3916, 65'437}, {4096, 69632}},
      {{65'536, 65'536, 4000}, {69'632, 69'632, 262'144}},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(testing::PrintToString(one.texts));
    const TempDir temp;
    inTracingChild(temp.path("t"), [&] {
      for (const size_t length : one.texts) message(std::string(length, 't'));
      EXPECT_EQ(sizesOfFiles(temp.path("t"), static_cast<uint64_t>(getpid())), one.sizes);
    });
  }
}

TEST(TrcFiles, TakeNoMoreThanTheBoundAndAllOfIt) {
  struct Case {
    uint64_t bound;
    std::vector<uint64_t> sizes;
  };
  const Case cases[] = {
      {4096, {4096}},           {8191, {4096}},           {8192, {4096, 4096}},
      {12'287, {4096, 4096}},   {12'288, {4096, 8192}},   {69'631, {4096, 61'440}},
      {69'632, {4096, 65'536}}, {73'727, {4096, 65'536}}, {73'728, {4096, 65'536, 4096}},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.bound);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                fake::useClock(1'000'000'000);
                if (traceInto(temp.path("t"), std::to_string(one.bound).c_str()) != 0) return 1;
                uint64_t room = 0;
                for (const uint64_t size : one.sizes) room += (size - kPacketBytes) / 16;
                room -= kPacketBytes / 16;
                for (uint64_t i = 0; i < room + 3; ++i) {
                  fake::monotonic += 10;
                  record(kEntry, kDoesFileExist);
                }
                const auto tid = static_cast<uint64_t>(getpid());
                EXPECT_EQ(sizesOfFiles(temp.path("t"), tid), one.sizes);
                const auto found = files::readTrace(files::onlyTrace(temp.path("t")));
                EXPECT_THAT(files::recordsOf(found, tid, 0), SizeIs(room));
                const files::Packet& last =
                    found.at(files::nameOf(tid, 0, one.sizes.size() - 1)).packets.back();
                EXPECT_EQ(last.discarded, 3U);
                EXPECT_EQ(last.end, fake::monotonic);
                return 0;
              }),
              0);
  }
}

TEST(TrcFiles, ABoundBelowTheFirstFileIsRefused) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              EXPECT_NE(traceInto(temp.path("t"), "4095"), 0);
              EXPECT_FALSE(pathExists(temp.path("t")));
              EXPECT_EQ(traceInto(temp.path("t"), "4096"), 0);
              message("first");
              // One file is reserved already.
              EXPECT_NE(traceInto(temp.path("t"), "8191"), 0);
              EXPECT_NE(traceInto(temp.path("t"), "4096"), 0);
              EXPECT_NE(traceInto(temp.path("t"), "4095"), 0);
              EXPECT_EQ(traceInto(temp.path("t"), "8192"), 0);
              EXPECT_EQ(traceInto(temp.path("t"), "0x2000"), 0);
              EXPECT_EQ(traceInto(temp.path("t"), "0X2000"), 0);
              EXPECT_NE(traceInto(temp.path("t"), "0X1FFF"), 0);
              EXPECT_EQ(traceInto(temp.path("t"), ""), 0);
              return 0;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first"));
}

TEST(TrcFiles, NoSmallerRecordFollowsAMissingOne) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t"), "8192") != 0) return 1;
              message("first");
              message(std::string(9000, 't'));  // needs three pages
              message("small enough");
              EXPECT_EQ(traceInto(temp.path("t"), "16384"), 0);
              message(std::string(9000, 't'));
              message("last");
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("first", std::string(9000, 't'), "last"));
  EXPECT_EQ(discarded(reading), 2U);
}

// A thread that has stopped makes no system call for a record, however long it goes on.
TEST(TrcFiles, AThreadThatHasStoppedOpensNothingMore) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              static std::atomic<int> opened{0};
              static std::atomic<int> made{0};
              const auto countedOpenat = [](int directory, const char* path, int flags,
                                            mode_t mode) {
                ++opened;
                if ((flags & O_CREAT) != 0) ++made;
                return real::openat(directory, path, flags, mode);
              };
              if (traceInto(temp.path("t"), "4096") != 0) return 1;
              for (int i = 0; i < 246; ++i) record(kEntry, kDoesFileExist);
              instead::openat = countedOpenat;
              record(kEntry, kDoesFileExist);
              EXPECT_EQ(made, 0);
              opened = 0;
              for (int i = 0; i < 100; ++i) record(kEntry, kDoesFileExist);
              EXPECT_EQ(opened, 0);
              // Nor does one whose trace is gone.
              EXPECT_EQ(traceInto(temp.path("other")), 0);
              EXPECT_EQ(trcInit(), 0);  // a second attempt
              fs::remove_all(temp.path("other"));
              message("lost");
              opened = 0;
              for (int i = 0; i < 100; ++i) record(kEntry, kDoesFileExist);
              EXPECT_EQ(opened, 0);
              return 0;
            }),
            0);
}

// A new trace has files, a size and a count of its own.
TEST(TrcFiles, OfANewTraceBeginAnew) {
  const TempDir temp;
  inTracingChild(temp.path("a"), [&] {
    traceMuch(1);
    limitFileSizes(1'000);
    traceMuch(1);
    limitFileSizes(RLIM_INFINITY);
    EXPECT_EQ(traceInto(temp.path("b")), 0);
    message("first");
    const auto tid = static_cast<uint64_t>(getpid());
    EXPECT_THAT(sizesOfFiles(temp.path("b"), tid, 1), ElementsAre(4096));
    const auto found = files::readTrace(files::onlyTrace(temp.path("b")));
    EXPECT_EQ(found.at(files::nameOf(tid, 1, 0)).packets.back().discarded, 0U);
    const auto before = files::readTrace(files::onlyTrace(temp.path("a")));
    EXPECT_GT(before.at(files::nameOf(tid, 0, before.size() - 1)).packets.back().discarded, 0U);
    // Another name for the same directory is another directory.
    EXPECT_EQ(traceInto(temp.path("b") + "/."), 0);
    EXPECT_THAT(entries(temp.path("b")), SizeIs(2));
  });
}

// A record that is asked for while a file is made counts in that file.
TEST(TrcFiles, CountTheRecordsThatWereMissedForThem) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
      message("nested");
      return real::openat(directory, path, flags, mode);
    };
    message(std::string(5000, 't'));
    instead::openat = nullptr;
    const auto found = files::readTrace(files::onlyTrace(temp.path("t")));
    const auto tid = static_cast<uint64_t>(getpid());
    EXPECT_EQ(found.at(files::nameOf(tid, 0, 0)).packets.back().discarded, 0U);
    EXPECT_GT(found.at(files::nameOf(tid, 0, 1)).packets.back().discarded, 1U);
  });
}

// A thread that begins again has small files first, as a new thread has.
TEST(TrcFiles, AreSmallAgainAfterAStop) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t"), "69632") != 0) return 1;
              for (int i = 0; i < 246 + 4091 + 1; ++i) record(kEntry, kDoesFileExist);
              EXPECT_EQ(traceInto(temp.path("t")), 0);
              for (int i = 0; i < 251 + 1; ++i) record(kEntry, kDoesFileExist);
              EXPECT_THAT(sizesOfFiles(temp.path("t"), static_cast<uint64_t>(getpid())),
                          ElementsAre(4096, 65'536, 4096, 65'536));
              return 0;
            }),
            0);
}

}  // namespace
