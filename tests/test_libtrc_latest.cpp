// TRC_MODE=latest: the newest records are kept.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <barrier>
#include <filesystem>
#include <latch>
#include <map>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "test_libtrc_files.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

namespace {

int traceLatestInto(const std::string& directory, const char* max_bytes = nullptr) {
  setenv("TRC_MODE", "latest", 1);
  return traceInto(directory, max_bytes);
}

int traceLatestInto(const std::string& directory, uint64_t max_bytes) {
  return traceLatestInto(directory, std::to_string(max_bytes).c_str());
}

// The space of a trace's files, hidden ones too, in pages. The metadata does not count.
uint64_t bytesOf(const fs::path& trace) {
  std::map<ino_t, uint64_t> sizes;
  for (const fs::path& path : entries(trace)) {
    struct stat status;
    if (path.filename() == "metadata" || stat(path.c_str(), &status) != 0) continue;
    // The file without records is nearly all a hole. It has this name and, in the end, others.
    const bool is_blank = status.st_nlink > 1 || path.filename().string().starts_with(".blank");
    const auto bytes = static_cast<uint64_t>(is_blank ? status.st_blocks * 512 : status.st_size);
    sizes[status.st_ino] = (bytes + 4095) / 4096 * 4096;
  }
  uint64_t bytes = 0;
  for (const auto& [inode, size] : sizes) bytes += size;
  return bytes;
}

// The number in a file's name that has so many numbers after it.
uint64_t numberIn(const std::string& name, int after) {
  size_t end = name.size();
  for (; after > 0; --after) end = name.rfind('-', end - 1);
  return strtoull(name.c_str() + name.rfind('-', end - 1) + 1, nullptr, 10);
}

// The packets with records of one stream, in order. Checks what all files have in common.
std::vector<files::Packet> packetsOf(const fs::path& trace, uint64_t stream) {
  std::vector<files::Packet> packets;
  for (const fs::path& path : entries(trace)) {
    const std::string name = path.filename();
    if (!name.starts_with("stream-") || numberIn(name, 1) != stream) continue;
    const files::File file = files::readFile(path);
    EXPECT_LE(file.packets.size(), 2U) << name;
    const files::Packet& opening = file.packets.at(0);
    EXPECT_EQ(opening.tid, numberIn(name, 2)) << name;
    EXPECT_EQ(opening.instance, stream) << name;
    EXPECT_THAT(opening.records, IsEmpty());
    EXPECT_EQ(opening.number, 0U);
    EXPECT_EQ(opening.discarded, 0U);
    EXPECT_EQ(opening.begin, opening.end);
    if (file.packets.size() == 2) packets.push_back(file.packets[1]);
  }
  std::sort(packets.begin(), packets.end(),
            [](const auto& one, const auto& other) { return one.number < other.number; });
  for (size_t i = 1; i < packets.size(); ++i) {
    EXPECT_EQ(packets[i].number, packets[i - 1].number + 1);
    EXPECT_GE(packets[i].begin, packets[i - 1].end);
    EXPECT_GE(packets[i].discarded, packets[i - 1].discarded);
  }
  return packets;
}

// The numbers in the messages of a stream, which begin with them.
std::vector<uint64_t> numbersOf(const std::vector<files::Packet>& packets) {
  std::vector<uint64_t> numbers;
  for (const files::Packet& packet : packets) {
    for (const files::Record& record : packet.records) {
      numbers.push_back(strtoull(record.text.value_or("").c_str(), nullptr, 10));
    }
  }
  return numbers;
}

// Checks that the stream ends with message `last`, that none is missing between its messages, and that the readers
// are told how many are missing before them. Returns how many there are.
uint64_t expectLatest(const fs::path& trace, uint64_t stream, uint64_t last) {
  const std::vector<files::Packet> packets = packetsOf(trace, stream);
  const std::vector<uint64_t> numbers = numbersOf(packets);
  if (numbers.empty()) {
    ADD_FAILURE() << "stream " << stream << " is empty";
    return 0;
  }
  EXPECT_EQ(numbers.back(), last);
  for (size_t i = 1; i < numbers.size(); ++i) {
    if (numbers[i] != numbers[i - 1] + 1)
      ADD_FAILURE() << numbers[i] << " is after " << numbers[i - 1];
  }
  for (const files::Packet& packet : packets) EXPECT_EQ(packet.discarded, numbers.front() - 1);
  return numbers.size();
}

void numbered(uint64_t number, size_t filler = 0) {
  message(std::to_string(number) + std::string(filler, '.'));
}

// ---- One thread ----

TEST(TrcLatest, AThreadAloneKeepsThreeQuartersOfTheBound) {
  for (const uint64_t bound : {65'536U, 100'000U, 1'000'000U}) {
    SCOPED_TRACE(bound);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                if (traceLatestInto(temp.path("t"), bound) != 0) return 1;
                const fs::path trace = files::onlyTrace(temp.path("t"));
                const uint64_t records = bound / 10;
                for (uint64_t i = 1; i <= records; ++i) {
                  numbered(i, 20);
                  if (i % (records / 40) != 0) continue;
                  const uint64_t kept = expectLatest(trace, 0, i);
                  EXPECT_GE((kept + 1) * 48, std::min(i * 40, bound / 4 * 3)) << i;
                  EXPECT_LE(bytesOf(trace), bound);
                }
                return 0;
              }),
              0);
    const Reading reading = read(temp.path("t"));
    EXPECT_EQ(reading.exit_status, 0) << reading.errors;
    EXPECT_EQ(reading.events.size() + discarded(reading), bound / 10) << reading.errors;
    EXPECT_GT(discarded(reading, " packet"), 0U) << reading.errors;
  }
}

TEST(TrcLatest, WithoutABoundItIs64MiB) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t")) != 0) return 1;
              for (int i = 0; i < 5'000'000; ++i) record(kEntry, kDoesFileExist);
              const fs::path trace = files::onlyTrace(temp.path("t"));
              EXPECT_LE(bytesOf(trace), 64U << 20);
              EXPECT_GE(bytesOf(trace), 48U << 20);
              return 0;
            }),
            0);
}

TEST(TrcLatest, RecordsOfEverySizeAreCounted) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 300'000) != 0) return 1;
              std::mt19937_64 random(1);
              for (int i = 0; i < 100'000; ++i) {
                switch (random() % 5) {
                  case 0:
                    record(kEntry, kDoesFileExist, reinterpret_cast<void*>(random() % 2));
                    break;
                  case 1:
                    exitRecord(static_cast<long>(random() % 2 * random()));
                    break;
                  default:
                    message(std::string(random() % 8 == 0 ? random() % 3000 : random() % 50, 't'));
                }
              }
              const std::vector<files::Packet> packets =
                  packetsOf(files::onlyTrace(temp.path("t")), 0);
              uint64_t kept = 0;
              for (const files::Packet& packet : packets) kept += packet.records.size();
              EXPECT_EQ(kept + packets.back().discarded, 100'000U);
              EXPECT_EQ(packets.front().discarded, packets.back().discarded);
              return 0;
            }),
            0);
}

TEST(TrcLatest, ARecordThatNeedsMoreThanHalfOfTheShareIsLeftOut) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
              message("first");
              message(std::string(40'000, 't'));
              message(std::string(30'000, 't'));
              message("last");
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("first", std::string(30'000, 't'), "last"));
  EXPECT_EQ(discarded(reading), 1U) << reading.errors;
}

// Of the stream's files, in the order of their packets.
std::vector<uint64_t> sizesOf(const fs::path& trace, uint64_t stream) {
  std::map<uint64_t, uint64_t> by_number;
  for (const fs::path& path : entries(trace)) {
    const std::string name = path.filename();
    if (!name.starts_with("stream-") || numberIn(name, 1) != stream) continue;
    const files::File file = files::readFile(path);
    by_number[file.packets.at(1).number] = file.size;
  }
  std::vector<uint64_t> sizes;
  for (const auto& [number, size] : by_number) sizes.push_back(size);
  return sizes;
}

TEST(TrcLatest, FilesGrowToAPartOfTheShare) {
  constexpr uint64_t kOneMiB = 1 << 20;
  struct Case {
    uint64_t bound;
    int threads;
    int records;
    std::vector<uint64_t> sizes;
  };
  const Case cases[] = {
      {kOneMiB, 1, 8000, {4096, 65'536, 65'536}},  // a sixteenth of it
      {kOneMiB - 4096, 1, 5000, {4096, 32'768, 32'768, 32'768}},
      {kOneMiB, 2, 8000, {4096, 65'536, 65'536}},  // an eighth of the half
      {kOneMiB - 8192, 2, 5000, {4096, 32'768, 32'768, 32'768}},
      {256 * kOneMiB, 1, 100'000, {4096, 65'536, 262'144, kOneMiB, 16 * kOneMiB}},
      {512 * kOneMiB, 1, 100'000, {4096, 65'536, 262'144, kOneMiB, 16 * kOneMiB}},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(one.bound);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                if (traceLatestInto(temp.path("t"), one.bound) != 0) return 1;
                std::latch has_file(1), may_end(1);
                std::thread other([&] {
                  if (one.threads == 2) message("other");
                  has_file.count_down();
                  may_end.wait();
                });
                has_file.wait();
                for (int i = 0; i < one.records; ++i) record(kEntry, kDoesFileExist);
                const auto stream = static_cast<uint64_t>(one.threads - 1);
                EXPECT_EQ(sizesOf(files::onlyTrace(temp.path("t")), stream), one.sizes);
                may_end.count_down();
                other.join();
                return 0;
              }),
              0);
  }
}

TEST(TrcLatest, ItsNamesDoNotBecomeMoreAndMore) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
              for (int i = 0; i < 200'000; ++i) record(kEntry, kDoesFileExist);
              EXPECT_LE(entries(files::onlyTrace(temp.path("t"))).size(), 36U);
              return 0;
            }),
            0);
}

// ---- Readers ----

// A reader lists names and packets first and opens the files later.
TEST(TrcLatestReaders, FindEveryPacketThatTheyHaveSeenOrAnEmptyOne) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
              const fs::path trace = files::onlyTrace(temp.path("t"));
              constexpr int kRecordsOfFile = (4096 - 2 * 88) / 16;
              for (int i = 0; i < 50 * kRecordsOfFile; ++i) record(kEntry, kDoesFileExist);
              struct Seen {
                fs::path path;
                uint64_t offset;
                files::Packet packet;
              };
              for (int round = 0; round < 20; ++round) {
                std::vector<Seen> seen;
                for (const fs::path& path : entries(trace)) {
                  if (!path.filename().string().starts_with("stream-")) continue;
                  uint64_t offset = 0;
                  for (const files::Packet& packet : files::readFile(path).packets) {
                    seen.push_back({path, offset, packet});
                    offset += packet.packet_bits / 8;
                  }
                }
                std::sort(seen.begin(), seen.end(), [](const Seen& one, const Seen& other) {
                  return one.packet.begin < other.packet.begin;
                });
                int empty = 0;
                for (int file = 0; file < 13; ++file) {
                  for (int i = 0; i < kRecordsOfFile; ++i) record(kEntry, kDoesFileExist);
                  uint64_t time = 0;
                  uint64_t missing = 0;
                  empty = 0;
                  for (const Seen& one : seen) {
                    const files::Packet packet =
                        files::takePacket(contentsOf(one.path), one.offset);
                    EXPECT_GE(packet.begin, time) << one.path;
                    EXPECT_GE(packet.discarded, missing) << one.path;
                    time = packet.end;
                    missing = packet.discarded;
                    EXPECT_TRUE(one.offset == 0 || packet.packet_bits == one.packet.packet_bits);
                    if (packet.number != one.packet.number || packet.begin != one.packet.begin) {
                      ++empty;
                      EXPECT_THAT(packet.records, IsEmpty()) << one.path;
                    }
                  }
                }
                EXPECT_EQ(empty, 13);
                if (testing::Test::HasFailure()) return 1;
                for (int i = 0; i < round * 17; ++i) record(kEntry, kDoesFileExist);
              }
              return 0;
            }),
            0);
}

// A reader that has opened a file may go on reading it while the next one is filled.
TEST(TrcLatestReaders, HaveTheTimeOfAFileToFinishAnOpenOne) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
              const fs::path trace = files::onlyTrace(temp.path("t"));
              for (int i = 0; i < 20'000; ++i) record(kEntry, kDoesFileExist);
              for (int round = 0; round < 50; ++round) {
                struct Open {
                  int fd;
                  std::string content;
                };
                std::vector<Open> open_files;
                for (const fs::path& path : entries(trace)) {
                  if (path.filename().string().starts_with("stream-")) {
                    open_files.push_back({open(path.c_str(), O_RDONLY), contentsOf(path)});
                  }
                }
                const auto oldestIsWhole = [&] {
                  int changed = 0;
                  for (Open& file : open_files) {
                    std::string now(file.content.size(), '\0');
                    if (pread(file.fd, now.data(), now.size(), 0) < 0) ++changed;
                    // Only the number of missing records changes, and what the newest file gets.
                    const files::Packet before = files::takePacket(file.content, 0);
                    const uint64_t next = before.packet_bits / 8;
                    if (next >= file.content.size()) continue;
                    const files::Packet was = files::takePacket(file.content, next);
                    const files::Packet is = files::takePacket(now, next);
                    if (is.number != was.number || is.records.size() < was.records.size())
                      ++changed;
                  }
                  return changed == 0;
                };
                for (int i = 0; i < 244; ++i) record(kEntry, kDoesFileExist);
                EXPECT_TRUE(oldestIsWhole());
                for (Open& file : open_files) close(file.fd);
              }
              return 0;
            }),
            0);
}

// True if babeltrace2 opens each file once for its list of packets. Others may fail if a thread begins a file before
// they have shown the first record.
bool listsInOneLook() {
  FILE* const output = popen("babeltrace2 --version", "r");
  char text[64] = "";
  if (output == nullptr || fgets(text, sizeof text, output) == nullptr) return false;
  (void)pclose(output);
  return std::string_view(text).find(" 2.0.") != std::string_view::npos;
}

// babeltrace2 reads again and again while a thread begins at most one file during each reading.
TEST(TrcLatestReaders, ReadWithoutAnErrorWhileItIsWritten) {
  constexpr int kReadings = 100;
  const bool lists_in_one_look = listsInOneLook();
  const TempDir temp;
  struct Shared {
    std::atomic<int> begun;  // readings during which the thread writes
    std::atomic<int> ended;  // those for which it has written
    std::atomic<uint64_t> written;
  };
  void* const memory =
      mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(memory, MAP_FAILED);
  auto* const shared = new (memory) Shared{};
  const pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    if (traceLatestInto(temp.path("t"), 1 << 20) != 0) _exit(1);
    uint64_t number = 0;
    const auto write = [&] {
      numbered(++number, 1000);
      shared->written = number;
    };
    while (number < 3000) write();
    for (int reading = 1; reading <= kReadings; ++reading) {
      while (shared->begun < reading) usleep(100);
      for (int i = 0; i < 50; ++i) {
        write();
        usleep(500);
      }
      shared->ended = reading;
    }
    _exit(0);
  }
  const auto waitForWriter = [shared](int reading) {
    while (shared->ended < reading) usleep(100);
  };
  while (shared->written < 3000) usleep(1000);
  for (int reading = 1; reading <= kReadings; ++reading) {
    const uint64_t before = shared->written;
    const bool writes_from_beginning = lists_in_one_look && reading % 2 == 0;
    if (writes_from_beginning) shared->begun = reading;
    const Reading found = read(temp.path("t"), [&] {
      if (writes_from_beginning) return;
      shared->begun = reading;
      waitForWriter(reading);
    });
    ASSERT_EQ(found.exit_status, 0) << found.errors;
    ASSERT_EQ(found.errors.find("ERROR"), std::string::npos) << found.errors;
    ASSERT_GT(found.events.size(), 700U);
    uint64_t last = 0;
    for (const Event& event : found.events) {
      const uint64_t number = strtoull(event.text.c_str(), nullptr, 10);
      ASSERT_GT(number, last);
      last = number;
    }
    ASSERT_GE(last, before);
    waitForWriter(reading);
  }
  int status = -1;
  waitpid(pid, &status, 0);
  EXPECT_EQ(status, 0);
  munmap(memory, sizeof(Shared));
}

// ---- Threads ----

TEST(TrcLatestThreads, TwoHundredHaveAtLeastOnePacketEach) {
  constexpr int kThreads = 200;
  for (const uint64_t bound : {1U << 20, 4U << 20}) {
    SCOPED_TRACE(bound);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                if (traceLatestInto(temp.path("t"), bound) != 0) return 1;
                for (uint64_t i = 1; i <= 2 * bound / 100; ++i) numbered(i, 80);  // all of it
                std::barrier all(kThreads + 1);
                std::vector<std::thread> threads;
                for (int t = 0; t < kThreads; ++t) {
                  threads.emplace_back([&all] {
                    numbered(1);
                    all.arrive_and_wait();
                    all.arrive_and_wait();
                    for (uint64_t i = 2; i <= 2000; ++i) numbered(i);
                    all.arrive_and_wait();
                    all.arrive_and_wait();
                  });
                }
                all.arrive_and_wait();
                const fs::path trace = files::onlyTrace(temp.path("t"));
                EXPECT_LE(bytesOf(trace), bound);
                for (uint64_t t = 1; t <= kThreads; ++t) expectLatest(trace, t, 1);
                all.arrive_and_wait();
                all.arrive_and_wait();
                EXPECT_LE(bytesOf(trace), bound);
                expectLatest(trace, 0, 2 * bound / 100);
                for (uint64_t t = 1; t <= kThreads; ++t) expectLatest(trace, t, 2000);
                all.arrive_and_wait();
                for (std::thread& thread : threads) thread.join();
                return 0;
              }),
              0);
    const Reading reading = read(temp.path("t"));
    EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  }
}

TEST(TrcLatestThreads, WhatAnotherThreadTakesIsCounted) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 1 << 20) != 0) return 1;
              for (uint64_t i = 1; i <= 30'000; ++i) numbered(i, 20);
              const fs::path trace = files::onlyTrace(temp.path("t"));
              const uint64_t alone = expectLatest(trace, 0, 30'000);
              std::thread([&] {
                for (uint64_t i = 1; i <= 30'000; ++i) numbered(i, 20);
                const uint64_t other = expectLatest(trace, 1, 30'000);
                const uint64_t own = expectLatest(trace, 0, 30'000);
                EXPECT_LT(own, alone);
                EXPECT_NEAR(static_cast<double>(own), static_cast<double>(other), 5000);
                EXPECT_LE(bytesOf(trace), 1U << 20);
              }).join();
              // The thread has ended, so that all of the bound is this thread's again.
              for (uint64_t i = 30'001; i <= 90'000; ++i) numbered(i, 20);
              EXPECT_GE(expectLatest(trace, 0, 90'000) * 48, (1U << 20) / 4 * 3);
              EXPECT_THAT(packetsOf(trace, 1), IsEmpty());
              EXPECT_LE(bytesOf(trace), 1U << 20);
              return 0;
            }),
            0);
}

TEST(TrcLatestThreads, WhatIsTakenFromAThreadThatEndedIsCounted) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 1 << 20) != 0) return 1;
              numbered(1);
              constexpr uint64_t kRecords = 15'000;
              std::thread([] {
                for (uint64_t i = 1; i <= kRecords; ++i) numbered(i, 20);
              }).join();
              const fs::path trace = files::onlyTrace(temp.path("t"));
              int partly = 0;
              for (uint64_t i = 2; !packetsOf(trace, 1).empty(); ++i) {
                if (expectLatest(trace, 1, kRecords) < kRecords) ++partly;
                for (int j = 0; j < 500; ++j, ++i) numbered(i, 20);
              }
              EXPECT_GE(partly, 3);
              return 0;
            }),
            0);
}

TEST(TrcLatestThreads, ThatEndedGiveTheirFilesBackOldestFirst) {
  constexpr uint64_t kThreads = 3000;
  constexpr uint64_t kBound = 512 << 10;
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), kBound) != 0) return 1;
              const fs::path trace = files::onlyTrace(temp.path("t"));
              numbered(1);
              for (uint64_t t = 1; t <= kThreads; ++t) {
                std::thread([t] {
                  for (uint64_t i = 1; i <= t % 1000; ++i) numbered(i);
                  numbered(t % 1000 + 1);
                }).join();
                if (t % 100 != 0) continue;
                EXPECT_LE(bytesOf(trace), kBound);
              }
              expectLatest(trace, 0, 1);
              for (uint64_t t = kThreads - 5; t <= kThreads; ++t) {
                expectLatest(trace, t, t % 1000 + 1);
              }
              EXPECT_THAT(packetsOf(trace, 1), IsEmpty());
              for (const fs::path& path : entries(trace)) {
                EXPECT_FALSE(path.filename().string().starts_with(".spare")) << path;
              }
              return 0;
            }),
            0);
  EXPECT_EQ(read(temp.path("t")).exit_status, 0);
}

// A thread that has come round has an empty file beside the others.
TEST(TrcLatestThreads, ThatEndedGiveTheirEmptyFilesBackToo) {
  constexpr uint64_t kThreads = 10;
  constexpr uint64_t kRecords = 3000;
  constexpr uint64_t kBound = 64 << 10;
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), kBound) != 0) return 1;
              const fs::path trace = files::onlyTrace(temp.path("t"));
              numbered(1);
              for (uint64_t t = 1; t <= kThreads; ++t) {
                std::thread([] {
                  for (uint64_t i = 1; i <= kRecords; ++i) numbered(i);
                }).join();
                expectLatest(trace, t, kRecords);
                const std::vector<fs::path> paths = entries(trace);
                // That of this thread, and that of the one before, if it has files left.
                EXPECT_LE(std::count_if(paths.begin(), paths.end(),
                                        [](const fs::path& path) {
                                          return path.filename().string().starts_with(".blank");
                                        }),
                          2)
                    << t;
              }
              return 0;
            }),
            0);
}

TEST(TrcLatestThreads, AThreadThatFoundNoRoomContinuesWhenAnotherEnds) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 8192) != 0) return 1;
              numbered(1);
              std::latch has_file(1), may_end(1);
              std::thread other([&] {
                numbered(1);
                has_file.count_down();
                may_end.wait();
              });
              has_file.wait();
              uint64_t i = 2;
              for (; i <= 1000; ++i) numbered(i);
              const fs::path trace = files::onlyTrace(temp.path("t"));
              EXPECT_LT(numbersOf(packetsOf(trace, 0)).back(), 1000U);
              may_end.count_down();
              other.join();
              numbered(i);
              EXPECT_EQ(numbersOf(packetsOf(trace, 0)).back(), i);
              EXPECT_LE(bytesOf(trace), 8192U);
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
}

int mappedFilesOfTraces() {
  const std::string maps = contentsOf("/proc/self/maps");
  int count = 0;
  for (const char* const name : {"stream-", ".spare-", ".blank-"}) {
    for (size_t at = 0; (at = maps.find(name, at)) != std::string::npos; ++at) ++count;
  }
  return count;
}

TEST(TrcLatestThreads, LeaveNoMappingBehind) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 1 << 20) != 0) return 1;
              const int descriptors = openDescriptors();
              message("first");
              EXPECT_EQ(mappedFilesOfTraces(), 1);
              std::thread([] {
                for (int i = 0; i < 100'000; ++i) record(kEntry, kDoesFileExist);
                EXPECT_GT(mappedFilesOfTraces(), 6);
              }).join();
              EXPECT_EQ(mappedFilesOfTraces(), 1);
              EXPECT_EQ(openDescriptors(), descriptors);
              return 0;
            }),
            0);
}

// ---- Fork and trcInit() ----

TEST(TrcLatestFork, AChildHasATraceAndABoundOfItsOwn) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 1 << 20) != 0) return 1;
              for (uint64_t i = 1; i <= 40'000; ++i) numbered(i, 20);
              const fs::path trace = files::onlyTrace(temp.path("t"));
              const uint64_t kept = expectLatest(trace, 0, 40'000);
              EXPECT_EQ(inChild([&] {
                          numbered(1, 20);
                          EXPECT_EQ(mappedFilesOfTraces(), 1);
                          for (uint64_t i = 2; i <= 40'000; ++i) numbered(i, 20);
                          for (const fs::path& path : entries(temp.path("t"))) {
                            EXPECT_LE(bytesOf(path), 1U << 20);
                            EXPECT_EQ(expectLatest(path, 0, 40'000), kept);
                          }
                          return 0;
                        }),
                        0);
              EXPECT_THAT(entries(temp.path("t")), SizeIs(2));
              EXPECT_EQ(expectLatest(trace, 0, 40'000), kept);
              for (uint64_t i = 40'001; i <= 80'000; ++i) numbered(i, 20);
              expectLatest(trace, 0, 80'000);
              return 0;
            }),
            0);
}

TEST(TrcLatestFork, WorksWithoutThePageThatTheKernelClears) {
  const TempDir temp;
  const std::string command = std::string(kFailingAtLoad) + "=madvise TRC_MODE=latest TRC_DIR='" +
                              temp.path("t") + "' TRC_MAX_BYTES=65536 " +
                              fs::read_symlink("/proc/self/exe").string() +
                              " --gtest_also_run_disabled_tests "
                              "--gtest_filter=TrcLatestFork.DISABLED_TracesInAChild >/dev/null";
  EXPECT_EQ(system(command.c_str()), 0);
  EXPECT_THAT(entries(temp.path("t")), SizeIs(2));
  EXPECT_EQ(read(temp.path("t")).exit_status, 0);
}

TEST(TrcLatestFork, DISABLED_TracesInAChild) {
  for (uint64_t i = 1; i <= 5000; ++i) numbered(i);
  EXPECT_EQ(inChild([] {
              for (uint64_t i = 1; i <= 5000; ++i) numbered(i);
              EXPECT_LE(mappedFilesOfTraces(), 17);
              return 0;
            }),
            0);
  numbered(5001);
}

TEST(TrcLatestAgain, TheSameSettingsContinueTheTrace) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
              for (uint64_t i = 1; i <= 5000; ++i) {
                numbered(i);
                if (i % 500 != 0) continue;
                EXPECT_EQ(trcInit(), 0);
              }
              expectLatest(files::onlyTrace(temp.path("t")), 0, 5000);
              return 0;
            }),
            0);
}

TEST(TrcLatestAgain, AChangedBoundHoldsFromTheNextFileOn) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceLatestInto(temp.path("t"), 1 << 20) != 0) return 1;
              const fs::path trace = files::onlyTrace(temp.path("t"));
              uint64_t i = 1;
              for (; i <= 60'000; ++i) numbered(i);
              for (const uint64_t bound : {524'288U, 65'536U}) {
                EXPECT_EQ(traceLatestInto(temp.path("t"), bound), 0);
                for (const uint64_t end = i + 20'000; i != end; ++i) numbered(i);
                EXPECT_LE(bytesOf(trace), bound);
                expectLatest(trace, 0, i - 1);
              }
              EXPECT_EQ(traceLatestInto(temp.path("t"), 1 << 20), 0);
              for (; i <= 200'000; ++i) numbered(i);
              EXPECT_GE(expectLatest(trace, 0, i - 1) * 32, (1U << 20) / 4 * 3);
              EXPECT_LE(bytesOf(trace), 1U << 20);
              return 0;
            }),
            0);
}

TEST(TrcLatestAgain, AnotherModeBeginsAnotherTrace) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("oldest");
              EXPECT_EQ(traceLatestInto(temp.path("t"), 1 << 20), 0);
              for (uint64_t i = 1; i <= 40'000; ++i) numbered(i);
              // What the earlier trace has taken is not available again.
              EXPECT_NE(traceLatestInto(temp.path("other"), 500'000), 0);
              EXPECT_EQ(traceLatestInto(temp.path("other"), 2 << 20), 0);
              EXPECT_EQ(mappedFilesOfTraces(), 1);
              numbered(1);
              EXPECT_EQ(mappedFilesOfTraces(), 1);
              unsetenv("TRC_MODE");
              EXPECT_EQ(traceInto(temp.path("t")), 0);
              message("oldest again");
              return 0;
            }),
            0);
  EXPECT_THAT(entries(temp.path("t")), SizeIs(3));
  EXPECT_THAT(texts(readEvents(temp.path("other"))), ElementsAre("1"));
  int numbered_traces = 0;
  for (const fs::path& trace : entries(temp.path("t"))) {
    if (contentsOf(trace / "metadata").find("packet_seq_num") != std::string::npos)
      ++numbered_traces;
  }
  EXPECT_EQ(numbered_traces, 1);
}

TEST(TrcLatestAgain, AnUnknownModeIsRefusedAndChangesNothing) {
  const TempDir temp;
  for (const char* const bad : {"last", "LATEST", "latest ", " latest", "latest,", "first", "0"}) {
    SCOPED_TRACE(bad);
    EXPECT_EQ(inChild([&] {
                setenv("TRC_MODE", bad, 1);
                setenv("TRC_EVENTS", "entry", 1);
                setenv("TRC_DIR", temp.path("t").c_str(), 1);
                trcEvents = 0x5000;
                EXPECT_NE(trcInit(), 0);
                EXPECT_EQ(trcEvents, 0x5000U);
                EXPECT_FALSE(pathExists(temp.path("t")));
                setenv("TRC_MODE", "", 1);
                EXPECT_EQ(trcInit(), 0);
                EXPECT_EQ(trcEvents, 0x1000U);
                return 0;
              }),
              0);
    fs::remove_all(temp.path("t"));
  }
}

// ---- Failures ----

TEST(TrcLatestFailures, AFullFileSystemKeepsTheNewest) {
  REQUIRE_ROOT("to mount a small file system");
  const TempDir temp;
  const std::string small = temp.dir("small");
  EXPECT_EQ(withPrivateMounts([&] {
              if (mount("none", small.c_str(), "tmpfs", 0, "size=1m") != 0) return 1;
              if (traceLatestInto(small + "/t", 16 << 20) != 0) return 2;
              for (uint64_t i = 1; i <= 60'000; ++i) numbered(i, 20);
              EXPECT_GT(expectLatest(files::onlyTrace(small + "/t"), 0, 60'000), 1000U);
              EXPECT_EQ(read(small + "/t").exit_status, 0);
              return 0;
            }),
            0);
}

TEST(TrcLatestFailures, WithoutLinksExchangesOrHolesTheNewestRecordsAreKept) {
  for (const std::string call : {"ftruncate", "linkat", "renameat2"}) {
    SCOPED_TRACE(call);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                if (call == "ftruncate") {
                  instead::ftruncate = [](int, off_t) {
                    errno = EFBIG;
                    return -1;
                  };
                } else if (call == "linkat") {
                  instead::linkat = [](int, const char*, int, const char*, int) {
                    errno = EPERM;
                    return -1;
                  };
                } else {
                  instead::renameat2 = [](int, const char*, int, const char*, unsigned int) {
                    errno = EINVAL;
                    return -1;
                  };
                }
                if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
                const fs::path trace = files::onlyTrace(temp.path("t"));
                for (uint64_t i = 1; i <= 10'000; ++i) numbered(i);
                EXPECT_GT(expectLatest(trace, 0, 10'000), 65'536U / 2 / 32);
                EXPECT_LE(bytesOf(trace), 65'536U);
                return 0;
              }),
              0);
    EXPECT_EQ(read(temp.path("t")).exit_status, 0);
  }
}

std::atomic<int> calls_left{0};
bool failsThisTime() { return calls_left.fetch_sub(1) == 1; }

// One call fails, whichever it is: the trace stays readable, and at most the records of one file are lost.
TEST(TrcLatestFailures, AnyCallThatFailsLeavesAReadableTrace) {
  const auto failing = [](int kind) {
    instead::openat = nullptr;
    instead::write = nullptr;
    instead::renameat = nullptr;
    instead::renameat2 = nullptr;
    instead::linkat = nullptr;
    instead::madvise = nullptr;
    instead::unlinkat = nullptr;
    instead::ftruncate = nullptr;
    switch (kind) {
      case 0:
        instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
          return failsThisTime() ? (errno = EMFILE, -1)
                                 : real::openat(directory, path, flags, mode);
        };
        break;
      case 1:
        instead::write = [](int descriptor, const void* data, size_t bytes) -> ssize_t {
          return failsThisTime() ? (errno = ENOSPC, -1) : real::write(descriptor, data, bytes);
        };
        break;
      case 2:
        instead::renameat = [](int from_directory, const char* from, int to_directory,
                               const char* to) {
          return failsThisTime() ? (errno = EIO, -1)
                                 : real::renameat(from_directory, from, to_directory, to);
        };
        break;
      case 3:
        instead::renameat2 = [](int from_directory, const char* from, int to_directory,
                                const char* to, unsigned int flags) {
          return failsThisTime() ? (errno = EINVAL, -1)
                                 : static_cast<int>(syscall(SYS_renameat2, from_directory, from,
                                                            to_directory, to, flags));
        };
        break;
      case 4:
        instead::linkat = [](int from_directory, const char* from, int to_directory, const char* to,
                             int flags) {
          return failsThisTime() ? (errno = EMLINK, -1)
                                 : static_cast<int>(syscall(SYS_linkat, from_directory, from,
                                                            to_directory, to, flags));
        };
        break;
      case 5:
        instead::madvise = [](void* at, size_t bytes, int advice) {
          return failsThisTime() ? (errno = ENOMEM, -1) : real::madvise(at, bytes, advice);
        };
        break;
      case 6:
        instead::ftruncate = [](int descriptor, off_t bytes) {
          return failsThisTime() ? (errno = ENOSPC, -1)
                                 : static_cast<int>(syscall(SYS_ftruncate, descriptor, bytes));
        };
        break;
      default:
        instead::unlinkat = [](int directory, const char* path, int flags) {
          return failsThisTime() ? (errno = EIO, -1) : real::unlinkat(directory, path, flags);
        };
    }
  };
#ifdef SANITIZER_OWNS_MALLOC
  constexpr int kStep = 9;
#else
  constexpr int kStep = 3;
#endif
  for (int kind = 0; kind <= 7; ++kind) {
    for (int nth = 1; nth <= 60; nth += kind == 0 ? kStep + 4 : kStep) {
      SCOPED_TRACE("call " + std::to_string(kind) + ", time " + std::to_string(nth));
      const TempDir temp;
      EXPECT_EQ(inChild([&] {
                  if (traceLatestInto(temp.path("t"), 65'536) != 0) return 1;
                  const fs::path trace = files::onlyTrace(temp.path("t"));
                  calls_left = nth;
                  failing(kind);
                  for (uint64_t i = 1; i <= 4000; ++i) numbered(i);
                  failing(7);
                  instead::unlinkat = nullptr;
                  EXPECT_EQ(trcInit(), 0);
                  for (uint64_t i = 4001; i <= 4200; ++i) numbered(i);
                  const Reading reading = read(temp.path("t"));
                  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
                  EXPECT_EQ(reading.events.back().text, "4200");
                  if (kind == 7) return 0;  // a file that could not be removed stays
                  const std::vector<files::Packet> packets = packetsOf(trace, 0);
                  EXPECT_EQ(numbersOf(packets).size() + packets.back().discarded, 4200U);
                  EXPECT_LE(bytesOf(trace), 65'536U);
                  return 0;
                }),
                0);
    }
  }
}

// ---- Termination by SIGKILL ----

TEST(TrcLatestKilled, EveryTraceIsReadableAndEndsWithTheLastCompletedRecord) {
#ifdef SANITIZER_OWNS_MALLOC
  constexpr int kProcesses = 100;
#else
  constexpr int kProcesses = 1000;
#endif
  constexpr int kThreads = 2;
  constexpr uint64_t kBound = 128 << 10;
  struct Noted {
    std::atomic<uint64_t> last[kThreads];
  };
  const TempDir temp;
  void* const memory =
      mmap(nullptr, sizeof(Noted), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(memory, MAP_FAILED);
  std::minstd_rand random(2);
  int overwritten = 0;
  int with_hidden = 0;

  for (int process = 0; process < kProcesses; ++process) {
    SCOPED_TRACE(process);
    auto* const noted = new (memory) Noted{};
    const std::string root = temp.path("t");
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      if (traceLatestInto(root, kBound) != 0) _exit(1);
      const auto trace = [noted](int t) {
        for (uint64_t number = 1;; ++number) {
          message(std::to_string(number) + " " + std::to_string(t) + std::string(150, '.'));
          noted->last[t].store(number, std::memory_order_relaxed);
        }
      };
      std::thread other(trace, 1);
      trace(0);
    }
    if (process % 8 == 0) {
      usleep(static_cast<useconds_t>(random() % 2000));
    } else {
      const uint64_t enough = random() % 3000;
      while (noted->last[0].load(std::memory_order_relaxed) <= enough) usleep(10);
      usleep(static_cast<useconds_t>(random() % 50));
    }
    ASSERT_EQ(kill(pid, SIGKILL), 0);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFSIGNALED(status)) << "it ended by itself: " << status;

    std::vector<fs::path> traces;
    if (fs::exists(root)) traces = entries(root);
    for (const fs::path& trace : traces) {
      if (isHidden(trace)) continue;
      EXPECT_LE(bytesOf(trace), kBound);
      for (uint64_t stream = 0; stream < kThreads; ++stream) {
        const std::vector<files::Packet> packets = packetsOf(trace, stream);
        std::vector<uint64_t> numbers = numbersOf(packets);
        if (numbers.empty()) continue;
        const std::string& text = packets.front().records.at(0).text.value();
        const int t = text.at(text.find(' ') + 1) - '0';
        for (size_t i = 1; i < numbers.size(); ++i) ASSERT_EQ(numbers[i], numbers[i - 1] + 1);
        const uint64_t last = noted->last[t].load();
        EXPECT_GE(numbers.back(), last);
        EXPECT_LE(numbers.back(), last + 1);
        EXPECT_GE(packets.back().discarded + 1, numbers.front());
        if (numbers.front() > 1) ++overwritten;
        noted->last[t] = 0;
      }
      for (int t = 0; t < kThreads; ++t) EXPECT_EQ(noted->last[t].load(), 0U) << "thread " << t;
      for (const fs::path& path : entries(trace)) {
        const std::string name = path.filename().string();
        if (!name.starts_with('.')) continue;
        EXPECT_THAT(name, ::testing::MatchesRegex("\\.(spare|blank)-[0-9]+-[0-9]+"));
        if (name.starts_with(".spare")) ++with_hidden;
      }
      if (process % 10 == 0) {
        const Reading reading = read(trace);
        EXPECT_EQ(reading.exit_status, 0) << reading.errors;
        EXPECT_EQ(reading.errors.find("ERROR"), std::string::npos) << reading.errors;
      }
    }
    ASSERT_FALSE(testing::Test::HasFailure());
    fs::remove_all(root);
  }
  EXPECT_GE(overwritten, kProcesses / 3);
  EXPECT_GE(with_hidden, kProcesses / 3);
  munmap(memory, sizeof(Noted));
}

}  // namespace
