// What remains when a call of libtrc fails, and how it makes its calls.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <linux/magic.h>
#include <malloc.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <functional>
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

// The files of traces that this process has mapped.
int mappedFiles() {
  std::ifstream maps("/proc/self/maps");
  int count = 0;
  for (std::string line; std::getline(maps, line);) {
    if (line.find("stream-") != std::string::npos) ++count;
  }
  return count;
}

std::vector<std::string> namesIn(const fs::path& directory) {
  std::vector<std::string> names;
  for (const fs::path& path : entries(directory)) names.push_back(path.filename());
  return names;
}

bool allocatesPages(int advice) {
  return advice == MADV_POPULATE_WRITE || advice == MADV_POPULATE_READ;
}

// ---- Mappings ----

TEST(TrcMappings, AreOneForEachThreadAndEndWithIt) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    EXPECT_EQ(mappedFiles(), 0);
    message("main");
    EXPECT_EQ(mappedFiles(), 1);
    traceMuch(1);  // several files, one after the other
    EXPECT_EQ(mappedFiles(), 1);
    std::thread([] {
      message("thread");
      EXPECT_EQ(mappedFiles(), 2);
      traceMuch(1);
      EXPECT_EQ(mappedFiles(), 2);
    }).join();
    EXPECT_EQ(mappedFiles(), 1);
    EXPECT_EQ(traceInto(temp.path("other")), 0);
    message("main");
    EXPECT_EQ(mappedFiles(), 1);
  });
}

TEST(TrcMappings, AreUnmappedWithSignalsBlocked) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    static std::atomic<int> unmapped{0};
    static std::atomic<int> unblocked{0};
    instead::munmap = [](void* at, size_t bytes) {
      sigset_t mask;
      if (bytes == 4096) ++unmapped;
      if (bytes == 4096 &&
          (pthread_sigmask(SIG_BLOCK, nullptr, &mask) != 0 || sigismember(&mask, SIGUSR1) == 0)) {
        ++unblocked;
      }
      return real::munmap(at, bytes);
    };
    std::thread([] { message("first"); }).join();
    EXPECT_EQ(unmapped, 1);
    EXPECT_EQ(unblocked, 0);
  });
}

// Twice would unmap what another thread has mapped there meanwhile.
TEST(TrcMappings, AreUnmappedOnce) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    static std::atomic<int> mapped{0};
    static std::atomic<int> unmapped{0};
    instead::madvise = [](void* at, size_t bytes, int advice) {
      if (allocatesPages(advice)) ++mapped;
      return real::madvise(at, bytes, advice);
    };
    instead::munmap = [](void* at, size_t bytes) {
      if (bytes <= (1 << 20)) ++unmapped;
      return real::munmap(at, bytes);
    };
    static pthread_key_t late;
    ASSERT_EQ(pthread_key_create(&late, [](void*) { message("late"); }), 0);
    std::thread([] {
      message("first");
      message(std::string(3950, 't'));
      pthread_setspecific(late, &late);
    }).join();
    EXPECT_EQ(mapped, unmapped);
    EXPECT_GE(mapped, 2);
  });
}

// On a disk's file system, a page that is mapped for reading is mapped again when it is written.
TEST(TrcMappings, AreForWritingUnlessTheFileSystemIsTmpfs) {
  struct Case {
    int result;
    long type;
    int advice;
  };
  for (const Case& one :
       {Case{0, TMPFS_MAGIC, MADV_POPULATE_READ}, Case{0, EXT4_SUPER_MAGIC, MADV_POPULATE_WRITE},
        Case{-1, TMPFS_MAGIC, MADV_POPULATE_WRITE}}) {
    SCOPED_TRACE(one.type);
    const TempDir temp;
    inTracingChild(temp.path("t"), [&] {
      static Case file_system;
      static int others = 0;
      file_system = one;
      instead::fstatfs = [](int, struct statfs* out) {
        out->f_type = file_system.type;
        return file_system.result;
      };
      instead::madvise = [](void* at, size_t bytes, int advice) {
        if (advice != file_system.advice) ++others;
        return real::madvise(at, bytes, advice);
      };
      traceMuch(1);
      EXPECT_EQ(others, 0);
    });
    EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1000));
  }
}

// A thread whose new trace is gone has no file.
TEST(TrcMappings, OfAFormerTraceAreNotUsed) {
  const TempDir temp;
  inTracingChild(temp.path("a"), [&] {
    message("first");
    EXPECT_EQ(traceInto(temp.path("b")), 0);
    fs::remove_all(temp.path("b"));
    message("lost");
    message("lost");
    EXPECT_EQ(mappedFiles(), 0);
  });
  EXPECT_THAT(texts(readEvents(temp.path("a"))), ElementsAre("first"));
}

// ---- The surroundings of its calls ----

std::atomic<int> calls_seen{0};
std::atomic<int> calls_interruptible{0};

// Whether a signal or a cancellation could interrupt the calling thread now.
bool isInterruptible() {
  sigset_t mask;
  if (pthread_sigmask(SIG_BLOCK, nullptr, &mask) != 0) return true;
  for (const int signal : {SIGHUP, SIGTERM, SIGUSR1, SIGALRM, SIGCHLD, SIGXFSZ}) {
    if (sigismember(&mask, signal) == 0) return true;
  }
  int state = PTHREAD_CANCEL_ENABLE;
  (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &state);
  (void)pthread_setcancelstate(state, nullptr);
  return state != PTHREAD_CANCEL_DISABLE;
}

TEST(TrcCalls, AreNotInterruptedAndLeaveNoDescriptorToAnExecutedProgram) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              static std::atomic<int> inherited{0};
              instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
                ++calls_seen;
                if (isInterruptible()) ++calls_interruptible;
                if ((flags & O_CLOEXEC) == 0) ++inherited;
                return real::openat(directory, path, flags, mode);
              };
              EXPECT_EQ(traceInto(temp.path("t")), 0);
              EXPECT_GT(calls_seen, 3);
              const int during_init = calls_seen;
              message("first");
              EXPECT_GT(calls_seen, during_init + 2);
              EXPECT_EQ(calls_interruptible, 0);
              EXPECT_EQ(inherited, 0);
              EXPECT_TRUE(isInterruptible());
              return 0;
            }),
            0);
}

// A program may trace from its own munmap().
TEST(TrcCalls, MayTraceWhileAFileIsUnmapped) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    instead::munmap = [](void* at, size_t bytes) {
      const int result = real::munmap(at, bytes);
      if (bytes >= 4096 && bytes <= (4 << 20)) message("nested");
      return result;
    };
    message(std::string(5000, 't'));
    instead::munmap = nullptr;
    message("last");
  });
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("first", std::string(5000, 't'), "last"));
  EXPECT_EQ(discarded(reading), 1U) << reading.errors;
}

// A thread that waits for another one's file sleeps meanwhile.
TEST(TrcCalls, WaitAsleepForEachOther) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    static std::atomic<int> waiting_tid{0};
    static std::atomic<bool> is_first_inside{false};
    static std::atomic<int> asleep{0};
    instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
      if (!is_first_inside.exchange(true)) {
        for (int waited = 0; asleep < 20 && waited < 60'000; ++waited) {
          usleep(1000);
          if (waiting_tid == 0) continue;
          const std::string stat =
              contentsOf("/proc/self/task/" + std::to_string(waiting_tid) + "/stat");
          asleep = stat.find(") S ") != std::string::npos ? asleep + 1 : 0;
        }
      }
      return real::openat(directory, path, flags, mode);
    };
    // While a trace is begun the process is locked.
    std::thread first([] { EXPECT_EQ(trcInit(), 0); });
    while (!is_first_inside) usleep(100);
    std::thread second([] {
      waiting_tid = gettid();
      message("second");
    });
    first.join();
    second.join();
    EXPECT_EQ(asleep, 20);
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("second"));
}

// ---- Calls that fail ----

std::atomic<int> failures_left{0};

bool failsNow() { return failures_left > 0 && failures_left.fetch_sub(1) > 0; }

// Lets a thread's next file fail as `arrange` says, and checks that nothing remains of it and that trcInit() has the
// thread continue.
void expectAFileLessAndNoMore(const std::function<void()>& arrange) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("t"), "8192") != 0) return 1;
              message("first");
              const std::vector<std::string> names = namesIn(files::onlyTrace(temp.path("t")));
              EXPECT_THAT(names, SizeIs(2));
              const int descriptors = openDescriptors();
              const int mapped = mappedFiles();
              arrange();
              failures_left = 1;
              message(std::string(3950, 'a'));
              EXPECT_EQ(failures_left, 0) << "the call was not made";
              failures_left = 0;
              EXPECT_EQ(openDescriptors(), descriptors);
              EXPECT_EQ(mappedFiles(), mapped);
              EXPECT_EQ(namesIn(files::onlyTrace(temp.path("t"))), names);
              message(std::string(3950, 'b'));
              // What the file would have taken is left.
              EXPECT_EQ(trcInit(), 0);
              message(std::string(3950, 'c'));
              EXPECT_THAT(namesIn(files::onlyTrace(temp.path("t"))), SizeIs(3));
              return 0;
            }),
            0);
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(reading.events, SizeIs(2));
  EXPECT_TRUE(reading.events.back().text == std::string(3950, 'c'));
  EXPECT_EQ(discarded(reading), 2U) << reading.errors;
}

TEST(TrcFailures, AFileThatCannotBeMapped) {
  expectAFileLessAndNoMore([] {
    instead::mmap = [](void* at, size_t bytes, int protection, int flags, int file,
                       off_t offset) -> void* {
      if (file >= 0 && failsNow()) {
        errno = ENOMEM;
        return MAP_FAILED;
      }
      return reinterpret_cast<void*>(syscall(SYS_mmap, at, bytes, protection, flags, file, offset));
    };
  });
}

TEST(TrcFailures, AFileWhosePagesCannotBeAllocated) {
  for (const int error : {ENOMEM, EFAULT, EHWPOISON}) {
    SCOPED_TRACE(error);
    static int the_error;
    the_error = error;
    expectAFileLessAndNoMore([] {
      instead::madvise = [](void* at, size_t bytes, int advice) {
        if (allocatesPages(advice) && bytes == 4096 && failsNow()) {
          errno = the_error;
          return -1;
        }
        return real::madvise(at, bytes, advice);
      };
    });
  }
}

// Before Linux 5.14 there is no MADV_POPULATE_WRITE.
TEST(TrcFailures, AKernelThatDoesNotAllocatePagesAtOnce) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    instead::madvise = [](void*, size_t, int) {
      errno = EINVAL;
      return -1;
    };
    traceMuch(1);
  });
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(1000));
}

TEST(TrcFailures, AFileThatCannotBeOpened) {
  expectAFileLessAndNoMore([] {
    instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
      if ((flags & O_CREAT) == 0 || !failsNow()) return real::openat(directory, path, flags, mode);
      errno = ENFILE;
      return -1;
    };
  });
}

TEST(TrcFailures, AFileThatCannotBeRenamed) {
  expectAFileLessAndNoMore([] {
    instead::renameat = [](int from_directory, const char* from, int to_directory, const char* to) {
      if (failsNow()) {
        errno = EIO;
        return -1;
      }
      return real::renameat(from_directory, from, to_directory, to);
    };
  });
}

TEST(TrcFailures, AFileThatCannotBeWritten) {
  expectAFileLessAndNoMore([] {
    instead::write = [](int descriptor, const void* data, size_t bytes) -> ssize_t {
      if (bytes == 4096 && failsNow()) return 0;
      return real::write(descriptor, data, bytes);
    };
  });
  expectAFileLessAndNoMore([] {
    instead::write = [](int descriptor, const void* data, size_t bytes) -> ssize_t {
      if (bytes == 4096 && failsNow()) {
        errno = ENOSPC;
        return -1;
      }
      return real::write(descriptor, data, bytes);
    };
  });
}

TEST(TrcFailures, WritesThatWriteAPartOnly) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    instead::write = [](int descriptor, const void* data, size_t bytes) {
      return real::write(descriptor, data, bytes > 1 ? bytes - 1 : 1);
    };
    EXPECT_EQ(traceInto(temp.path("other")), 0);
    traceMuch(1);
    const auto found = files::readTrace(files::onlyTrace(temp.path("other")));
    EXPECT_EQ(found.at(files::nameOf(static_cast<uint64_t>(getpid()), 0, 0)).size, 4096U);
  });
  EXPECT_THAT(readEvents(temp.path("other")), SizeIs(1000));
}

// Fails the calls of trcInit() one by one; `call` makes its nth call fail. Nothing remains below the directory.
void expectInitFails(const std::function<void(int)>& arrange, int times) {
  for (int nth = 1; nth <= times; ++nth) {
    SCOPED_TRACE(nth);
    const TempDir temp;
    EXPECT_EQ(inChild([&] {
                const int descriptors = openDescriptors();
                arrange(nth);
                EXPECT_NE(traceInto(temp.dir("t")), 0);
                EXPECT_EQ(failures_left, 0) << "the call was not made";
                failures_left = 0;
                EXPECT_EQ(openDescriptors(), descriptors);
                EXPECT_THAT(entries(temp.path("t")), IsEmpty());
                message("lost");
                EXPECT_THAT(entries(temp.path("t")), IsEmpty());
                EXPECT_EQ(traceInto(temp.path("t")), 0);
                message("recorded");
                return 0;
              }),
              0);
    EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("recorded"));
  }
}

// Lets the nth call from now on fail.
bool isTheOne() { return failures_left > 0 && failures_left.fetch_sub(1) == 1; }

TEST(TrcFailures, InitThatGetsNoUuid) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::getrandom = [](void* out, size_t bytes, unsigned int) -> ssize_t {
          memset(out, 7, bytes);
          return isTheOne() ? static_cast<ssize_t>(bytes) - 1 : static_cast<ssize_t>(bytes);
        };
      },
      1);
}

TEST(TrcFailures, InitThatCannotRename) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::renameat = [](int from_directory, const char* from, int to_directory,
                               const char* to) {
          if (!isTheOne()) return real::renameat(from_directory, from, to_directory, to);
          errno = EIO;
          return -1;
        };
      },
      2);  // the metadata and the directory
}

TEST(TrcFailures, InitThatCannotWrite) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::write = [](int descriptor, const void* data, size_t bytes) -> ssize_t {
          if (!isTheOne()) return real::write(descriptor, data, bytes);
          errno = ENOSPC;
          return -1;
        };
      },
      2);  // the metadata and the first file's space
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::write = [](int descriptor, const void* data, size_t bytes) -> ssize_t {
          return isTheOne() ? 0 : real::write(descriptor, data, bytes);
        };
      },
      2);
}

TEST(TrcFailures, InitThatCannotLookAtItsDirectory) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::fstat = [](int descriptor, struct stat* status) {
          if (!isTheOne()) return real::fstat(descriptor, status);
          errno = EIO;
          return -1;
        };
      },
      1);
}

TEST(TrcFailures, InitThatCannotOpen) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::openat = [](int directory, const char* path, int flags, mode_t mode) {
          const bool is_needed = strcmp(path, fake::kBootId) != 0;
          if (!is_needed || !isTheOne()) return real::openat(directory, path, flags, mode);
          errno = EMFILE;
          return -1;
        };
      },
      4);  // TRC_DIR, the trace, its metadata, the first file
}

TEST(TrcFailures, InitThatCannotKnowTheLimitOfFileSizes) {
  expectInitFails(
      [](int nth) {
        failures_left = nth;
        instead::getrlimit = [](rlimit* limit) {
          limit->rlim_cur = RLIM_INFINITY;
          return isTheOne() ? -1 : 0;
        };
      },
      2);
}

// The file that shows that there is room must be gone.
TEST(TrcFailures, AFirstFileThatCannotBeRemoved) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    instead::unlinkat = [](int directory, const char* path, int flags) {
      if (strcmp(path, ".room") != 0) return real::unlinkat(directory, path, flags);
      errno = EPERM;
      return -1;
    };
    EXPECT_NE(trcInit(), 0);
    EXPECT_THAT(namesIn(files::onlyTrace(temp.path("t"))), testing::Contains(".room"));
    instead::unlinkat = nullptr;
    EXPECT_EQ(trcInit(), 0);
    EXPECT_THAT(namesIn(files::onlyTrace(temp.path("t"))), SizeIs(2));
    // Without room the thread's trace goes on where it was.
    instead::getrlimit = [](rlimit*) { return -1; };
    EXPECT_NE(trcInit(), 0);
    instead::getrlimit = nullptr;
    message("second");
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
}

TEST(TrcFailures, ADirectoryOnAnotherDeviceIsNotTheTrace) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    const int descriptors = openDescriptors();
    instead::fstat = [](int descriptor, struct stat* status) {
      const int result = real::fstat(descriptor, status);
      ++status->st_dev;
      return result;
    };
    message(std::string(3950, 't'));
    EXPECT_EQ(openDescriptors(), descriptors);
    instead::fstat = nullptr;
    EXPECT_EQ(trcInit(), 0);
    message("last");
  });
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("first", "last"));
  EXPECT_EQ(discarded(reading), 1U) << reading.errors;
  EXPECT_THAT(entries(temp.path("t")), SizeIs(1));
}

TEST(TrcFailures, ADirectoryThatCannotBeLookedAtIsNotTheTrace) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    instead::fstat = [](int descriptor, struct stat* status) {
      (void)real::fstat(descriptor, status);
      errno = EIO;
      return -1;
    };
    message(std::string(3950, 't'));
  });
  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("first"));
  EXPECT_EQ(discarded(reading), 1U) << reading.errors;
}

// Descriptor 0 is not what is left of a directory that could not be opened.
TEST(TrcFailures, ADirectoryThatIsGoneChangesNoDescriptor) {
  for (const bool is_trace_only : {true, false}) {
    SCOPED_TRACE(is_trace_only);
    const TempDir temp;
    inTracingChild(temp.path("t"), [&] {
      message("first");
      const int descriptors = openDescriptors();
      fs::remove_all(is_trace_only ? files::onlyTrace(temp.path("t")) : fs::path(temp.path("t")));
      message(std::string(3950, 't'));
      EXPECT_EQ(openDescriptors(), descriptors);
    });
  }
}

TEST(TrcFailures, APipeInThePlaceOfTheDirectoryIsRefusedAtOnce) {
  const TempDir temp;
  ASSERT_EQ(mkfifo(temp.path("t").c_str(), 0600), 0);
  EXPECT_EQ(inChild([&] {
              alarm(60);
              EXPECT_NE(traceInto(temp.path("t")), 0);
              return 0;
            }),
            0);
}

// ---- Limits ----

void limitFileSize(uint64_t bytes) {
  rlimit limit;
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &limit), 0);
  limit.rlim_cur = bytes;
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
}

// More than a limit would raise SIGXFSZ.
TEST(TrcFileSizes, UpToTheLimitAreWritten) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              fake::useClock(1'000'000'000);
              if (traceInto(temp.path("a")) != 0) return 1;
              const uint64_t metadata =
                  fs::file_size(files::onlyTrace(temp.path("a")) / "metadata");
              EXPECT_GT(metadata, 4096U);
              limitFileSize(metadata - 1);
              EXPECT_NE(traceInto(temp.path("b")), 0);
              EXPECT_THAT(entries(temp.path("b")), IsEmpty());
              limitFileSize(metadata);
              EXPECT_EQ(traceInto(temp.path("b")), 0);
              limitFileSize(4095);
              EXPECT_NE(trcInit(), 0);
              message("lost, and not counted");
              EXPECT_THAT(namesIn(files::onlyTrace(temp.path("b"))), ElementsAre("metadata"));
              limitFileSize(4096);
              EXPECT_EQ(trcInit(), 0);
              message("first");
              limitFileSize(65'535);
              message(std::string(3950, 'a'));
              EXPECT_THAT(namesIn(files::onlyTrace(temp.path("b"))), SizeIs(2));
              return 0;
            }),
            0);
  EXPECT_EQ(inChild([&] {
              if (traceInto(temp.path("c")) != 0) return 1;
              message("first");
              limitFileSize(65'536);
              message(std::string(3950, 'a'));
              EXPECT_THAT(namesIn(files::onlyTrace(temp.path("c"))), SizeIs(3));
              return 0;
            }),
            0);
}

// A path that leads to `name` below `directory` and has this length.
std::string pathOfLength(size_t length, const std::string& directory, const std::string& name) {
  std::string path = directory;
  if ((length - path.size() - name.size()) % 2 == 0) path += '/';
  while (path.size() + 1 + name.size() < length) path += "/.";
  path += "/" + name;
  EXPECT_EQ(path.size(), length);
  return path;
}

// The next test runs this in a separate process with the switches set.
TEST(TrcPaths, DISABLED_RecordsWhetherTheSwitchesAreUsed) {
  writeFile(getenv("TEST_MASK_FILE"), std::to_string(trcEvents));
  message("recorded");
}

TEST(TrcPaths, AreShorterThanThePlatformsLimit) {
  const TempDir temp;
  const std::string self = fs::read_symlink("/proc/self/exe").string();
  const auto maskWith = [&](const std::string& directory, const std::string& working_directory) {
    setenv("TEST_MASK_FILE", temp.path("mask").c_str(), 1);
    const std::string command = "cd '" + working_directory + "' && TRC_DIR='" + directory +
                                "' TRC_EVENTS=0x7000 " + self +
                                " --gtest_also_run_disabled_tests "
                                "--gtest_filter=TrcPaths.DISABLED_RecordsWhether* >/dev/null";
    EXPECT_EQ(system(command.c_str()), 0);
    unsetenv("TEST_MASK_FILE");
    return contentsOf(temp.path("mask"));
  };
  const std::string mask = std::to_string(0x7000);
  EXPECT_EQ(maskWith(pathOfLength(PATH_MAX - 1, temp.path(), "a"), "/"), mask);
  EXPECT_THAT(texts(readEvents(temp.path("a"))), ElementsAre("recorded"));
  EXPECT_EQ(maskWith(pathOfLength(PATH_MAX, temp.path(), "b"), "/"), "0");
  EXPECT_FALSE(pathExists(temp.path("b")));
  // Relative: the working directory and a slash come before it.
  const size_t prefix = temp.path().size() + 1;
  EXPECT_EQ(maskWith(pathOfLength(PATH_MAX - 1 - prefix, ".", "c"), temp.path()), mask);
  EXPECT_THAT(texts(readEvents(temp.path("c"))), ElementsAre("recorded"));
  EXPECT_EQ(maskWith(pathOfLength(PATH_MAX - prefix, ".", "d"), temp.path()), "0");
  EXPECT_FALSE(pathExists(temp.path("d")));
}

TEST(TrcPaths, AreRefusedWhereTheWorkingDirectoryIsGone) {
  const TempDir temp;
  EXPECT_EQ(inChild([&] {
              if (chdir(temp.dir("gone").c_str()) != 0) return 1;
              fs::remove(temp.path("gone"));
              trcEvents = 0x5000;
              setenv("TRC_EVENTS", "all", 1);
              setenv("TRC_DIR", "t", 1);
              EXPECT_NE(trcInit(), 0);
              EXPECT_EQ(trcEvents, 0x5000U);
              return 0;
            }),
            0);
}

// ---- Memory ----

TEST(TrcMemory, ThatIsMissingLeavesTheTraceAsItWas) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    instead::no_memory = true;
    EXPECT_NE(traceInto(temp.path("other")), 0);
    instead::no_memory = false;
    message("second");
  });
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "second"));
}

// Settings that have not changed, or are invalid, are not kept. See docs/tracing.md for those that have.
TEST(TrcMemory, IsKeptForNewSettingsOnly) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    const auto grownBy = [&](const std::function<void()>& body) {
      const size_t before = mallinfo2().uordblks;
      for (int i = 0; i < 100; ++i) body();
      return mallinfo2().uordblks - before;
    };
    setenv("TRC_MAX_BYTES", "100000", 1);
    (void)trcInit();
    EXPECT_EQ(grownBy([] { (void)trcInit(); }), 0U);
    setenv("TRC_MAX_BYTES", "many", 1);
    EXPECT_EQ(grownBy([] { (void)trcInit(); }), 0U);
    setenv("TRC_MAX_BYTES", "1", 1);
    EXPECT_EQ(grownBy([] { (void)trcInit(); }), 0U);
  });
}

// ---- Failures while the library is loaded ----

TEST(TrcLoading, DISABLED_FindsNoTrace) {
  EXPECT_EQ(trcInit(), -1);
  message("nowhere");
  traceMuch(1);
  std::thread([] { message("nowhere"); }).join();
  EXPECT_EQ(trcEvents, 0U);
}

TEST(TrcLoading, DISABLED_ForksWhileItTraces) {
  message("parent");
  EXPECT_EQ(inChild([] {
              message("child");
              return 0;
            }),
            0);
  message("parent");
}

int runFailingAtLoad(const char* call, const std::string& directory, const char* test) {
  const std::string command =
      std::string(kFailingAtLoad) + "='" + call + "' TRC_DIR='" + directory + "' TRC_EVENTS=all " +
      fs::read_symlink("/proc/self/exe").string() +
      " --gtest_also_run_disabled_tests --gtest_filter=TrcLoading." + test + " >/dev/null";
  return system(command.c_str());
}

TEST(TrcLoading, ThatFailsLeavesTracingOff) {
  const TempDir temp;
  for (const char* const call : {"mmap", "pthread_key_create", "fork handlers"}) {
    SCOPED_TRACE(call);
    EXPECT_EQ(runFailingAtLoad(call, temp.path("t"), "DISABLED_FindsNoTrace"), 0);
    EXPECT_FALSE(pathExists(temp.path("t")));
  }
}

TEST(TrcLoading, WithoutWipingPagesAForkedChildHasItsOwnTrace) {
  for (const char* const call : {"", "madvise"}) {
    SCOPED_TRACE(call);
    const TempDir temp;
    EXPECT_EQ(runFailingAtLoad(call, temp.path("t"), "DISABLED_ForksWhileItTraces"), 0);
    const std::vector<fs::path> traces = entries(temp.path("t"));
    ASSERT_THAT(traces, SizeIs(2));
    std::vector<std::vector<std::string>> found = {texts(readEvents(traces[0])),
                                                   texts(readEvents(traces[1]))};
    EXPECT_THAT(found, testing::UnorderedElementsAre(ElementsAre("parent", "parent"),
                                                     ElementsAre("child")));
  }
}

}  // namespace
