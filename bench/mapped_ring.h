// The least that a trace record can cost: the time, and a copy of its bytes into memory that is mapped
// from a file and belongs to the thread. Nothing is published to a reader and old records are
// overwritten.
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
  // On the file system that the traces of the benchmark go to.
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

  // Room for a record of so many bytes.
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
