// Signals to the tool every 100 µs: handled ones, with and without SA_RESTART, and SIGSTOP with SIGCONT.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <string>
#include <thread>

#include "tool.h"
#include "tool_edits.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;

enum class Kind { kInterrupting, kRestarting, kStopping };

// Stops and continues a process until it ends. A descriptor of the process never means another one.
class Stopper {
 public:
  Stopper()
      : process_(static_cast<std::atomic<pid_t>*>(mmap(
            nullptr, sizeof(pid_t), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0))),
        thread_([this] { stopAndContinue(); }) {}
  ~Stopper() {
    is_done_ = true;
    thread_.join();
    (void)munmap(static_cast<void*>(process_), sizeof(pid_t));
  }
  Stopper(const Stopper&) = delete;
  Stopper& operator=(const Stopper&) = delete;

  // Called in the process, which waits until it is known.
  void stopMe() const {
    *process_ = getpid();
    while (*process_ != 0) usleep(100);
  }

 private:
  void stopAndContinue() const {
    while (*process_ == 0 && !is_done_) usleep(100);
    if (is_done_) return;
    const auto descriptor = static_cast<int>(syscall(SYS_pidfd_open, process_->load(), 0));
    *process_ = 0;
    const auto send = [&](int signal) {
      return syscall(SYS_pidfd_send_signal, descriptor, signal, nullptr, 0) == 0;
    };
    while (!is_done_ && send(SIGSTOP)) {
      usleep(100);
      (void)send(SIGCONT);
      usleep(100);
    }
    close(descriptor);
  }

  std::atomic<pid_t>* process_;
  std::atomic<bool> is_done_ = false;
  std::thread thread_;
};

class ToolStorm : public ::testing::TestWithParam<Kind> {
 protected:
  // Runs the tool in the storm.
  static Result storm(
      Arguments arguments, const std::function<void()>& prepare = [] {}) {
    const Stopper stopper;
    return osutils(std::move(arguments), [&] {
      prepare();
      if (GetParam() == Kind::kStopping) {
        stopper.stopMe();
        return;
      }
      setenv("LD_PRELOAD", STORM_PRELOAD, 1);
      setenv("ASAN_OPTIONS", "verify_asan_link_order=0:detect_odr_violation=0", 1);
      if (GetParam() == Kind::kRestarting) setenv("STORM_RESTARTS", "1", 1);
    });
  }

  const TempDir temp_;
};

std::string nameOf(const testing::TestParamInfo<Kind>& info) {
  switch (info.param) {
    case Kind::kInterrupting:
      return "Interrupting";
    case Kind::kRestarting:
      return "Restarting";
    default:
      return "Stopping";
  }
}

INSTANTIATE_TEST_SUITE_P(Of, ToolStorm,
                         ::testing::Values(Kind::kInterrupting, Kind::kRestarting, Kind::kStopping),
                         nameOf);

TEST_P(ToolStorm, EditsWaitForTheirLock) {
  for (const Family& family : kFamilies) {
    const std::string file = temp_.file(family.name, family.contents);
    LockHolder holder(file + ".lock");
    int err[2];
    ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
    Result addition;
    std::thread adding([&] {
      addition = storm(command(family.name, "add", file, family.addition),
                       [&] { dup2(err[1], STDERR_FILENO); });
    });
    std::string line;
    for (char c = 0; c != '\n' && read(err[0], &c, 1) == 1;) line += c;
    EXPECT_THAT(line, HasSubstr("waiting up to 15 s for "));
    usleep(60'000);
    holder.release();
    adding.join();
    for (const int end : err) close(end);
    EXPECT_EQ(addition.status, 0);
    EXPECT_EQ(contentsOf(file), std::string(family.contents) + family.added);

    EXPECT_EQ(storm(command(family.name, "delete", file, family.deletion)).status, 0);
    EXPECT_EQ(contentsOf(file), std::string(family.rest) + family.added);
    EXPECT_FALSE(pathExists(file + ".vrasave"));
  }
}

TEST_P(ToolStorm, ALongListIsPrintedToItsEnd) {
  std::string contents;
  std::string expected = "NAME    PORT\n";
  for (int i = 10'000; i < 11'500; ++i) {
    const std::string number = std::to_string(i);
    contents += "n" + number + "\t" + number + "/tcp\n";
    expected += "n" + number + "  " + number + "\n";
  }
  const std::string file = temp_.file("services", contents);
  const Result result = storm(command("services", "list", file));
  EXPECT_EQ(result.status, 0);
  EXPECT_TRUE(result.out == expected);
  EXPECT_EQ(result.err, "");
}

TEST_P(ToolStorm, TheLauncherIsWaitedFor) {
  const std::string launcher = temp_.file("vrarun", "#!/bin/sh\nsleep 0.1\nexit $1\n");
  ASSERT_EQ(chmod(launcher.c_str(), 0755), 0);
  const Arguments words = {"process", "start", "--launcher-dir", temp_.path()};
  for (const char* status : {"0", "7"}) {
    Arguments arguments = words;
    arguments.emplace_back(status);
    const Result result = storm(arguments);
    EXPECT_EQ(result.status, *status == '0' ? 0 : 3);
    EXPECT_THAT(result.err, *status == '0' ? HasSubstr("") : HasSubstr("exited with status 7"));
  }
}

TEST_P(ToolStorm, StandardInputIsReadToItsEnd) {
  int input[2];
  ASSERT_EQ(pipe2(input, O_CLOEXEC), 0);
  std::atomic<bool> ended = false;
  std::thread writer([&] {
    for (int i = 0; i < 20; ++i) {
      usleep(5'000);
      const std::string name = "cn = " + std::to_string(i) + "\n";
      EXPECT_EQ(write(input[1], name.data(), name.size()), static_cast<ssize_t>(name.size()));
    }
    // A tool that starts late would find the whole input and never wait, so that nothing is interrupted.
    for (int i = 0; GetParam() == Kind::kInterrupting && i < 10'000 && !ended; ++i) usleep(1'000);
    close(input[1]);
  });
  const Result result = storm({"dn", "format"}, [&] { dup2(input[0], STDIN_FILENO); });
  ended = true;
  writer.join();
  close(input[0]);
  if (GetParam() == Kind::kInterrupting) {
    // Only a preloaded library could have such a handler. The end of the input is not assumed.
    expectFailure(result, "osutils: dn format: operations error (1): cannot read standard input\n");
    return;
  }
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(std::count(result.out.begin(), result.out.end(), '\n'), 21);
  EXPECT_THAT(result.out, EndsWith("cn = 19  CN=19\n"));
  EXPECT_EQ(result.err, "");
}

}  // namespace
