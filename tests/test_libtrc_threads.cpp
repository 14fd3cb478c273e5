#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "test_libtrc.h"
#include "world.h"

using testing::Each;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::SizeIs;

namespace {

pthread_key_t late_key;

TEST(TrcThreads, ComeAndGo) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              // In one of its rounds, this destructor runs after the thread's stream was closed.
              if (pthread_key_create(&late_key, [](void* rounds) {
                    message("late");
                    if (const auto left = reinterpret_cast<intptr_t>(rounds); left > 1) {
                      pthread_setspecific(late_key, reinterpret_cast<void*>(left - 1));
                    }
                  }) != 0) {
                return 2;
              }
              for (int i = 0; i < 20; ++i) {
                std::thread([] {
                  message("early");
                  pthread_setspecific(late_key, reinterpret_cast<void*>(intptr_t{2}));
                }).join();
              }
              message("main");
              return 0;
            }),
            0);

  const std::vector<std::string> found = texts(readEvents(temp.path("t")));
  EXPECT_EQ(std::count(found.begin(), found.end(), "early"), 20);
  EXPECT_EQ(std::count(found.begin(), found.end(), "late"), 40);
  EXPECT_EQ(std::count(found.begin(), found.end(), "main"), 1);
}

TEST(TrcThreads, ThatAreShortTakeLittleSpace) {
  constexpr int kThreads = 3000;
  constexpr uintmax_t kMostBytes = 15'000'000;
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    for (int i = 0; i < kThreads; ++i) {
      std::thread([] {
        record(kEntry, kDoesFileExist);
        exitRecord(0);
      }).join();
    }
  });
  uintmax_t bytes = 0;
  int streams = 0;
  for (const fs::path& path : entries(entries(temp.path("t")).at(0))) {
    struct stat status;
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    bytes +=
        std::max<uintmax_t>(fs::file_size(path), static_cast<uintmax_t>(status.st_blocks) * 512);
    streams += path.filename() != "metadata";
  }
  EXPECT_EQ(streams, kThreads);
  EXPECT_LE(bytes, kMostBytes);
}

TEST(TrcFork, TheChildWritesItsOwnTrace) {
  const TempDir temp;
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0) return 1;
              message("before");
              const pid_t pid = fork();
              if (pid == 0) {
                for (int i = 0; i < 1000; ++i) message("child");
                std::thread([] { message("child"); }).join();
                _exit(0);
              }
              for (int i = 0; i < 1000; ++i) message("parent");
              int status = 0;
              if (waitpid(pid, &status, 0) != pid || status != 0) return 2;
              message("after");
              return 0;
            }),
            0);

  const std::vector<fs::path> traces = entries(temp.path("t"));
  ASSERT_THAT(traces, SizeIs(2));
  std::vector<Event> parent = readEvents(traces[0]);
  std::vector<Event> child = readEvents(traces[1]);
  if (child.empty() || child[0].text != "child") std::swap(parent, child);
  EXPECT_THAT(child, SizeIs(1001));
  EXPECT_THAT(texts(child), Each("child"));
  ASSERT_THAT(parent, SizeIs(1002));
  EXPECT_EQ(parent.front().text, "before");
  EXPECT_EQ(parent.back().text, "after");
  EXPECT_THAT(readEvents(temp.path("t")), SizeIs(2003));
}

TEST(TrcFork, AChildThatCannotTraceDoesNotCountInTheTraceOfItsParent) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("parent");
    fs::rename(temp.path("t"), temp.path("moved"));
    writeFile(temp.path("t"), "not a directory");
    EXPECT_EQ(inChild([] {
                message("child");
                message("child");
                return 0;
              }),
              0);
  });
  EXPECT_THAT(texts(readEvents(temp.path("moved"))), ElementsAre("parent"));
}

TEST(TrcSignals, AHandlerCanTrace) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    struct sigaction action = {};
    action.sa_handler = [](int) { message("handler"); };
    sigaction(SIGALRM, &action, nullptr);
    const itimerval often{{0, 200}, {0, 200}};
    setitimer(ITIMER_REAL, &often, nullptr);
    for (int i = 0; i < 50'000; ++i) message(std::to_string(i));
    const itimerval never{};
    setitimer(ITIMER_REAL, &never, nullptr);
  });

  const Reading reading = read(temp.path("t"));
  ASSERT_EQ(reading.exit_status, 0) << reading.errors;
  int next = 0;
  for (const Event& event : reading.events) {
    if (event.text == "handler") continue;
    ASSERT_EQ(event.text, std::to_string(next++));
  }
  EXPECT_EQ(next, 50'000);
}

char* guarded_text;
constexpr size_t kGuardedBytes = 4096;

void writeGuardedText() {
  mprotect(guarded_text, kGuardedBytes, PROT_READ | PROT_WRITE);
  memcpy(guarded_text, "outer", 5);
}

// Writes a message and interrupts that with a signal: copying the text raises SIGSEGV.
void messageInterruptedBy(void (*handler)(int)) {
  guarded_text = static_cast<char*>(
      mmap(nullptr, kGuardedBytes, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
  struct sigaction action = {};
  action.sa_handler = handler;
  sigaction(SIGSEGV, &action, nullptr);
  message(std::string_view(guarded_text, 5));
}

TEST(TrcSignals, ARecordAmidAnotherOneIsCountedAsDiscarded) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    messageInterruptedBy([](int) {
      message("nested");
      writeGuardedText();
    });
    message("last");
  });

  const Reading reading = read(temp.path("t"));
  EXPECT_EQ(reading.exit_status, 0);
  EXPECT_THAT(texts(reading.events), ElementsAre("first", "outer", "last"));
  EXPECT_THAT(reading.errors, HasSubstr("Tracer discarded 1 event between"));
}

TEST(TrcSignals, ARecordAmidTheFirstOneIsCountedAtOnce) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    messageInterruptedBy([](int) {
      message("nested");
      writeGuardedText();
    });
  });

  const Reading reading = read(temp.path("t"));
  EXPECT_THAT(texts(reading.events), ElementsAre("outer"));
  EXPECT_EQ(discarded(reading), 1U) << reading.errors;
}

// A child that a handler forks in the middle of a record must not count in its parent's trace.
TEST(TrcSignals, ARecordOfAChildThatAHandlerForkedIsNotCountedForItsParent) {
  const TempDir temp;
  inTracingChild(temp.path("t"), [&] {
    message("first");
    messageInterruptedBy([](int) {
      const pid_t pid = fork();
      if (pid == 0) {
        message("nested");
        _exit(0);
      }
      waitpid(pid, nullptr, 0);
      writeGuardedText();
    });
  });

  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "outer"));
}

// A child that continues the record that the handler interrupted must not overwrite what its parent
// has written since.
TEST(TrcSignals, AChildThatAHandlerForkedDoesNotFinishTheRecordOfItsParent) {
  const TempDir temp;
  static pid_t child;
  static int wait_here[2];
  ASSERT_EQ(inChild([&] {
              if (traceInto(temp.path("t")) != 0 || pipe(wait_here) != 0) return 1;
              message("first");
              messageInterruptedBy([](int) {
                writeGuardedText();
                child = fork();
                char byte;
                if (child == 0 && ::read(wait_here[0], &byte, 1) != 1) _exit(2);
              });
              if (child == 0) {
                message("child");
                _exit(0);
              }
              message("later");
              if (::write(wait_here[1], "x", 1) != 1) return 3;
              int status = -1;
              waitpid(child, &status, 0);
              return status;
            }),
            0);
  EXPECT_THAT(texts(readEvents(temp.path("t"))), ElementsAre("first", "outer", "later", "child"));
}

}  // namespace
