#include <fcntl.h>
#include <gmock/gmock.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "cancelled.h"
#include "faults.h"
#include "osutils.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

// Cancels the thread at each C library call of a file operation in turn. The operation must
// complete; the thread ends after it.
class CancelledFile : public TracedTest {
 protected:
  void expectFinished(std::initializer_list<Call> calls, const std::function<bool()>& operation,
                      const std::function<void()>& look) const {
    for (const Call at : calls) {
      SCOPED_TRACE(static_cast<int>(at));
      int asked = 0;
      for (int nth = 1;; ++nth) {
        SCOPED_TRACE(nth);
        const int open_before = openDescriptors();
        bool answer = false;
        const CancelledCall call = cancelledAt(at, nth, [&] { answer = operation(); });
        ASSERT_TRUE(call.returned);
        EXPECT_TRUE(answer);
        EXPECT_EQ(call.blocks, 0);
        EXPECT_EQ(openDescriptors(), open_before);
        look();
        EXPECT_EQ(call.ended, call.asked);
        if (!call.asked) break;
        ++asked;
      }
      EXPECT_GT(asked, 0) << "the operation makes no such call";
    }
  }
};
INSTANTIATE_TRACED_AND_NOT(CancelledFile);

TEST_P(CancelledFile, IsMade) {
  std::string path = temp_.file("file", "old");
  EXPECT_EQ(inChild([&] {
              expectFinished(
                  {Call::stat64, Call::remove, Call::umask, Call::open64, Call::fchown,
                   Call::fchmod, Call::close},
                  [&] { return createFile(path.data(), nullptr, nullptr, 0640); },
                  [&] { EXPECT_EQ(contentsOf(path), ""); });
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsCopied) {
  const std::string contents = randomBytes(100'000);
  const std::string source = temp_.file("source", contents);
  std::string made = temp_.path("made");
  std::string there = temp_.file("there", "old");
  EXPECT_EQ(inChild([&] {
              for (std::string* const to : {&made, &there}) {
                expectFinished(
                    {Call::stat64, Call::fopen64, Call::copy_file_range, Call::read, Call::fclose},
                    [&] { return copyFile(source.c_str(), to->data(), nullptr, nullptr, 0640); },
                    [&] {
                      EXPECT_TRUE(contentsOf(*to) == contents);
                      if (to == &made) unlink(made.c_str());
                    });
              }
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsProbed) {
  std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              expectFinished(
                  {Call::stat64, Call::fopen64, Call::fclose},
                  [&] { return canWriteToFile(path.data()); }, [] {});
              return 0;
            }),
            0);
}

TEST_P(CancelledFile, IsRead) {
  const std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              char* read = nullptr;
              expectFinished(
                  {Call::stat64, Call::fopen64, Call::fread, Call::fclose},
                  [&] {
                    const bool answer = readFile(path.c_str(), &read);
                    // The caller frees the buffer.
                    EXPECT_EQ(std::string(read, 8), "contents");
                    free(read);
                    return answer;
                  },
                  [] {});
              return 0;
            }),
            0);
}

// Only the lock is a cancellation point. If the thread ends there, the file is unchanged.
TEST_P(CancelledFile, IsEmptiedOrNot) {
  const std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              for (const Call at : {Call::stat64, Call::open64, Call::lockf64}) {
                SCOPED_TRACE(static_cast<int>(at));
                const int open_before = openDescriptors();
                const CancelledCall call =
                    cancelledAt(at, 1, [&] { (void)clearFile(path.c_str()); });
                EXPECT_TRUE(call.asked && call.ended);
                EXPECT_FALSE(call.returned);
                EXPECT_EQ(openDescriptors(), open_before);
                EXPECT_EQ(contentsOf(path), "contents");
              }
              expectFinished(
                  {Call::ftruncate64, Call::close}, [&] { return clearFile(path.c_str()); },
                  [&] { EXPECT_EQ(contentsOf(path), ""); });
              return 0;
            }),
            0);
}

// The thread is cancelled while it waits for a lock that another process holds.
TEST_P(CancelledFile, IsNotEmptiedByAThreadThatEndsWhileItWaits) {
  const std::string path = temp_.file("file", "contents");
  int held[2];
  ASSERT_EQ(pipe2(held, O_CLOEXEC), 0);
  const pid_t holder = fork();
  ASSERT_NE(holder, -1);
  if (holder == 0) {
    char token = 'x';
    const int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
    if (lockf64(descriptor, F_LOCK, 0) == 0 && write(held[1], &token, 1) == 1) pause();
    _exit(1);
  }
  char token = 'x';
  ASSERT_EQ(read(held[0], &token, 1), 1);
  EXPECT_EQ(inChild([&] {
              const int open_before = openDescriptors();
              // Cancelled before it waits, and while it waits.
              const CancelledCall before =
                  cancelledAt(Call::lockf64, 1, [&] { (void)clearFile(path.c_str()); });
              EXPECT_TRUE(before.asked && before.ended);
              EXPECT_FALSE(before.returned);
              EXPECT_EQ(openDescriptors(), open_before);

              pthread_t thread;
              const auto wait = [](void* file) -> void* {
                (void)clearFile(static_cast<const char*>(file));
                return nullptr;
              };
              EXPECT_EQ(pthread_create(&thread, nullptr, wait, const_cast<char*>(path.c_str())), 0);
              while (openDescriptors() == open_before) usleep(1'000);
              usleep(20'000);
              EXPECT_EQ(pthread_cancel(thread), 0);
              void* answer = nullptr;
              EXPECT_EQ(pthread_join(thread, &answer), 0);
              EXPECT_EQ(answer, PTHREAD_CANCELED);
              EXPECT_EQ(openDescriptors(), open_before);
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(path), "contents");
  EXPECT_EQ(kill(holder, SIGKILL), 0);
  int status = 0;
  EXPECT_EQ(waitpid(holder, &status, 0), holder);
  for (const int descriptor : held) close(descriptor);
}

// If cancellation was disabled before the call, it is disabled after it, and the call keeps waiting.
TEST_P(CancelledFile, LeavesTheStateOfTheThreadAsItWas) {
  const std::string path = temp_.file("file", "contents");
  std::string made = temp_.path("made");
  for (const int wanted : {PTHREAD_CANCEL_ENABLE, PTHREAD_CANCEL_DISABLE}) {
    int before = 0;
    ASSERT_EQ(pthread_setcancelstate(wanted, &before), 0);
    EXPECT_TRUE(clearFile(path.c_str()));
    EXPECT_TRUE(createFile(made.data(), nullptr, nullptr, 0640));
    int after = -1;
    ASSERT_EQ(pthread_setcancelstate(before, &after), 0);
    EXPECT_EQ(after, wanted);
  }
  EXPECT_EQ(inChild([&] {
              const CancelledCall call = cancelledAt(Call::lockf64, 1, [&] {
                int before = 0;
                (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &before);
                EXPECT_TRUE(clearFile(path.c_str()));
                (void)pthread_setcancelstate(before, nullptr);
              });
              EXPECT_TRUE(call.asked && call.returned && call.ended);
              return 0;
            }),
            0);
}

}  // namespace
