// The lower bound of what a trace record can cost: reading the time, and copying the record to the
// thread's own mapping of a file. Nothing is published to readers, and old records are overwritten.
#pragma once

#include <fcntl.h>
#include <stdint.h>
#include <string.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <new>

class MappedRing {
 public:
  // On the file system of the benchmark's traces.
  MappedRing() {
    const int file = open("/dev/shm", O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    if (file == -1 || ftruncate(file, kBytes) != 0) throw std::bad_alloc();
    void* const mapping = mmap(nullptr, kBytes, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    (void)close(file);
    if (mapping == MAP_FAILED) throw std::bad_alloc();
    memory_ = static_cast<unsigned char*>(mapping);
  }
  ~MappedRing() { (void)munmap(memory_, kBytes); }
  MappedRing(const MappedRing&) = delete;
  MappedRing& operator=(const MappedRing&) = delete;

  // Returns the place of the next record.
  unsigned char* next(size_t bytes) {
    if (at_ + bytes > kBytes) at_ = 0;
    unsigned char* const place = memory_ + at_;
    at_ += bytes;
    return place;
  }

  static uint64_t now() {
    timespec time;
    (void)clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
  }

 private:
  static constexpr size_t kBytes = 1 << 20;
  unsigned char* memory_;
  size_t at_ = 0;
};
