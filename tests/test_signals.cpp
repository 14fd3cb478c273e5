// A signal every 100 µs, with and without SA_RESTART, during the calls that wait: the results are those without
// signals. With the platform libraries as they are built.

#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldap_clientosutils.h>
#include <ldtr.h>
#include <net/if.h>
#include <netinet/in.h>
#include <osutils.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <tuple>

#include "exported_calls.h"
#include "signal_storm.h"
#include "test_libtrc.h"
#include "world.h"

using VRAOSUtils::EtcInittab;
using VRAOSUtils::EtcServices;

namespace {

constexpr useconds_t kWait = 40'000;

void pauseFor(useconds_t microseconds) {
  timespec left{0, static_cast<long>(microseconds) * 1000};
  while (nanosleep(&left, &left) != 0) {
  }
}

int64_t timeOf(clockid_t clock) {
  timespec time = {};
  (void)clock_gettime(clock, &time);
  return time.tv_sec * int64_t{1'000'000'000} + time.tv_nsec;
}

// A child process without the storm, which ends with its parent.
class Helper {
 public:
  explicit Helper(const std::function<void()>& body) : process_(fork()) {
    if (process_ != 0) return;
    (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
    body();
    _exit(0);
  }
  ~Helper() {
    (void)kill(process_, SIGKILL);
    (void)waitpid(process_, nullptr, 0);
  }
  Helper(const Helper&) = delete;
  Helper& operator=(const Helper&) = delete;

 private:
  pid_t process_;
};

void writeSlowly(const std::string& path, const std::string& text, size_t piece) {
  pauseFor(kWait);
  const int pipe = open(path.c_str(), O_WRONLY);
  for (size_t at = 0; at < text.size(); at += piece) {
    const std::string part = text.substr(at, piece);
    if (write(pipe, part.data(), part.size()) != static_cast<ssize_t>(part.size())) _exit(1);
    pauseFor(kWait / 4);
  }
  close(pipe);
}

// Reads from a pipe that is opened for writing again and again, until somebody has written.
std::string readSlowly(int descriptor) {
  std::string text;
  char piece[4096];
  for (ssize_t size; (size = read(descriptor, piece, sizeof piece)) > 0 || text.empty();) {
    if (size < 0) break;
    text.append(piece, static_cast<size_t>(size));
    pauseFor(1000);
  }
  return text;
}

// With these flags of sigaction(), and traced or not.
class Storm : public testing::TestWithParam<std::tuple<int, bool>> {
 protected:
  // Runs the body in a child process, in a storm.
  void inStorm(const std::function<void()>& body) const {
    EXPECT_EQ(inChild([&] { return stormy(body); }), 0);
    expectTrace();
  }

  int stormy(const std::function<void()>& body) const {
    (void)alarm(100);  // in case that the call never ends
    const auto [flags, is_traced] = GetParam();
    const SignalStorm storm(flags);
    if (is_traced) {
      setenv("TRC_DIR", traces_.c_str(), 1);
      setenv("TRC_EVENTS", "all", 1);
      EXPECT_EQ(ldtr_init(), 0);
    }
    body();
    EXPECT_GT(storm.handled(), 0);
    return 0;
  }

  void expectTrace() const {
    if (!std::get<1>(GetParam())) return;
    const auto events = readEvents(traces_);
    EXPECT_THAT(events, testing::Not(testing::IsEmpty()));
    int depth = 0;
    for (const Event& event : events) {
      depth += event.type.starts_with("\"entry\"") ? 1 : 0;
      depth -= event.type.starts_with("\"exit") ? 1 : 0;
    }
    EXPECT_EQ(depth, 0);
  }

  const TempDir temp_;
  const std::string traces_ = temp_.path("traces");
};

INSTANTIATE_TEST_SUITE_P(Of, Storm,
                         testing::Combine(testing::Values(0, SA_RESTART), testing::Bool()),
                         [](const auto& tested) {
                           return std::string(std::get<0>(tested.param) == 0 ? "Interrupting"
                                                                             : "Restarting") +
                                  (std::get<1>(tested.param) ? "Traced" : "");
                         });

TEST_P(Storm, ClearFileWaitsForItsLock) {
  const std::string path = temp_.file("file", "contents");
  int held[2];
  ASSERT_EQ(pipe(held), 0);
  const Helper holder([&] {
    const int descriptor = open(path.c_str(), O_RDWR);
    if (lockf(descriptor, F_LOCK, 0) != 0 || write(held[1], "x", 1) != 1) _exit(1);
    pauseFor(kWait);
    if (pwrite(descriptor, "last", 4, 0) != 4) _exit(1);
  });
  char token;
  ASSERT_EQ(read(held[0], &token, 1), 1);
  inStorm([&] {
    [[maybe_unused]] const int64_t start = timeOf(CLOCK_MONOTONIC);
    [[maybe_unused]] const int64_t used = timeOf(CLOCK_THREAD_CPUTIME_ID);
    EXPECT_TRUE(clearFile(path.c_str()));
#ifndef SANITIZER_OWNS_MALLOC
    EXPECT_LT(timeOf(CLOCK_THREAD_CPUTIME_ID) - used, (timeOf(CLOCK_MONOTONIC) - start) / 2);
#endif
  });
  EXPECT_EQ(contentsOf(path), "");  // not before "last" was written
  for (const int end : held) close(end);
}

TEST_P(Storm, ShellCommandsGiveTheirStatus) {
  temp_.file("vrarun", "#!/bin/sh\nsleep 0.04\nexit $1\n");
  ASSERT_EQ(chmod(temp_.path("vrarun").c_str(), 0755), 0);
  std::string tree = temp_.dir("tree");
  for (int i = 0; i < 200; ++i) writeFile(tree + "/" + std::to_string(i), "");
  inStorm([&] {
    EXPECT_EQ(startProcess(temp_.path().c_str(), "3"), 3 << 8);
    EXPECT_EQ(startProcess(temp_.path().c_str(), "0"), 0);
    EXPECT_TRUE(deleteDirForcefully(tree.data()));
    EXPECT_FALSE(isProcessStarted("2147483647", "nothing"));
    EXPECT_TRUE(isNPTL());
  });
  EXPECT_FALSE(pathExists(tree));
}

TEST_P(Storm, EditorsReadAPipeToItsEnd) {
  std::string services;
  std::string inittab;
  for (int i = 1; i <= 400; ++i) {
    services += "name" + std::to_string(i) + "\t" + std::to_string(i) + "/tcp\n";
    inittab += "i" + std::to_string(i) + ":2:once:/bin/true\n";
  }
  const std::string services_pipe = temp_.path("services");
  const std::string inittab_pipe = temp_.path("inittab");
  ASSERT_EQ(mkfifo(services_pipe.c_str(), 0600), 0);
  ASSERT_EQ(mkfifo(inittab_pipe.c_str(), 0600), 0);
  const Helper writer([&] {
    writeSlowly(services_pipe, services, 3000);
    writeSlowly(inittab_pipe, inittab, 3000);
  });
  inStorm([&] {
    EtcServices::ETC_SERVICES_FILE = services_pipe.c_str();
    EtcServices list;
    EXPECT_EQ(list.readEtcServices(), OSUTILS_SUCCESS);
    for (int i = 1; i <= 400; ++i) {
      EXPECT_EQ(list.getServicePort(("name" + std::to_string(i)).c_str()), i);
    }
    EtcInittab::ETC_INITTAB_FILE = inittab_pipe.c_str();
    EtcInittab entries;
    EXPECT_EQ(entries.readInittab(), OSUTILS_SUCCESS);
    for (int i = 1; i <= 400; ++i) {
      EXPECT_TRUE(entries.doesInittabEntryExist(("i" + std::to_string(i)).c_str()));
    }
  });
}

TEST_P(Storm, TheDatabaseIsFoundInAPipe) {
  temp_.dir("etc");
  const std::string pipe = temp_.path("etc/ldapdb.properties");
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  const Helper writer(
      [&] { writeSlowly(pipe, "currentXQ4InstallPath=/opt/xq4\ncurrentXQ4Version=9.1\n", 10); });
  inStorm([&] {
    setenv("VRA_LDAP_HOME", temp_.path().c_str(), 1);
    char* version = nullptr;
    char* const path = getXQ4PathAndVersion(&version);
    EXPECT_STREQ(path, "/opt/xq4");
    EXPECT_STREQ(version, "9.1");
    free(path);
    free(version);
  });
}

TEST_P(Storm, CopiesAreComplete) {
  std::string contents;
  for (int i = 0; i < 30'000; ++i) contents += std::to_string(i) + "\n";
  const std::string regular = temp_.file("regular", contents);
  const std::string pipe = temp_.path("pipe");
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  std::string from_pipe = temp_.path("from_pipe");
  std::string from_file = temp_.path("from_file");
  const std::string received = temp_.path("received");
  const Helper other_end([&] {
    writeSlowly(pipe, contents, 50'000);
    pauseFor(kWait);
    // The library opens the pipe twice: to find out whether it can write, and to write.
    const int end = open(pipe.c_str(), O_RDONLY);
    writeFile(received + ".part", readSlowly(end));
    std::filesystem::rename(received + ".part", received);  // appears whole
    close(end);
  });
  inStorm([&] {
    EXPECT_TRUE(copyFile(pipe.c_str(), from_pipe.data(), nullptr, nullptr, 0600));
    EXPECT_TRUE(copyFile(regular.c_str(), from_file.data(), nullptr, nullptr, 0600));
    std::string destination = pipe;
    EXPECT_TRUE(copyFile(regular.c_str(), destination.data(), nullptr, nullptr, 0600));
  });
  EXPECT_TRUE(contentsOf(from_pipe) == contents);
  EXPECT_TRUE(contentsOf(from_file) == contents);
  for (int waited = 0; !pathExists(received) && waited < 10'000; ++waited) pauseFor(1000);
  EXPECT_TRUE(contentsOf(received) == contents);
}

// Locks the mutex for a while, in a thread without the storm.
class Holder {
 public:
  Holder() {
    while (!is_held_) pauseFor(100);
  }
  ~Holder() { thread_.join(); }
  Holder(const Holder&) = delete;
  Holder& operator=(const Holder&) = delete;

  pthread_mutex_t* mutex() { return &mutex_; }
  bool hasReleased() const { return has_released_; }

 private:
  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
  std::atomic<bool> is_held_ = false;
  std::atomic<bool> has_released_ = false;
  std::thread thread_{[this] {
    (void)pthread_mutex_lock(&mutex_);
    is_held_ = true;
    pauseFor(kWait);
    has_released_ = true;
    (void)pthread_mutex_unlock(&mutex_);
  }};
};

TEST_P(Storm, AnUntimedLockWaits) {
  inStorm([] {
    Holder holder;
    const AutoLock lock(holder.mutex(), false);
    EXPECT_TRUE(holder.hasReleased());
    EXPECT_TRUE(doesFileExist("/"));  // the lock itself leaves no record
  });
}

// What is left of a wait after a signal includes the slack of the timer.
TEST_P(Storm, ATimedLockWaitsNoLonger) {
  inStorm([] {
    Holder holder;
    ASSERT_EQ(prctl(PR_SET_TIMERSLACK, 1'000'000), 0);
    (void)alarm(20);
    const AutoLock lock(holder.mutex(), true);
    EXPECT_TRUE(holder.hasReleased());
  });
}

TEST_P(Storm, EditsAreComplete) {
  const std::string file = temp_.file("services", "");
  const std::string backup = temp_.path("services.b");
  inStorm([&] {
    EtcServices::ETC_SERVICES_FILE = file.c_str();
    EtcServices::ETC_SERVICES_FILE_BACKUP = backup.c_str();
    EtcServices list;
    for (int i = 1; i <= 40; ++i) {
      const std::string name = "name" + std::to_string(i);
      EXPECT_EQ(list.addService(name.c_str(), i), OSUTILS_SUCCESS);
      if (i % 2 == 0) {
        EXPECT_EQ(list.deleteService(name.c_str()), OSUTILS_SUCCESS);
      }
    }
  });
  std::string expected;
  for (int i = 1; i <= 40; i += 2) {
    expected += "name" + std::to_string(i) + "\t" + std::to_string(i) + "/tcp\n";
  }
  EXPECT_EQ(contentsOf(file), expected);
  EXPECT_FALSE(pathExists(backup));
}

// All that call nothing that must be prepared outside.
TEST_P(Storm, EveryFunctionGivesItsResult) {
  const std::string directory = temp_.dir("calls");
  const auto calls = exportedCalls(directory);
  inStorm([&] {
    for (const ExportedCall& call : calls) {
      if (call.enters == Enters::kResolver) continue;
      SCOPED_TRACE(call.symbols.front());
      prepareCalls(directory);
      EXPECT_TRUE(call.body());
    }
  });
}

// ---- The resolver ----

// Answers each question about an IPv4 address with 192.0.2.1, and others with nothing, after a pause.
void serveNames(int descriptor) {
  unsigned char packet[512];
  sockaddr_storage from = {};
  for (;;) {
    socklen_t from_size = sizeof from;
    ssize_t size = recvfrom(descriptor, packet, sizeof packet - 16, 0,
                            reinterpret_cast<sockaddr*>(&from), &from_size);
    if (size < 12) continue;
    pauseFor(kWait / 2);
    ssize_t end = 12;
    while (end < size && packet[end] != 0) end += packet[end] + 1;
    end += 5;
    if (end > size) continue;
    const bool is_ipv4 = packet[end - 4] == 0 && packet[end - 3] == 1;
    const unsigned char header[] = {0x84, 0x80, 0, 1, 0, static_cast<unsigned char>(is_ipv4),
                                    0,    0,    0, 0};
    memcpy(packet + 2, header, sizeof header);
    const unsigned char answer[] = {0xc0, 12, 0, 1, 0, 1, 0, 0, 0, 0, 0, 4, 192, 0, 2, 1};
    if (is_ipv4) memcpy(packet + end, answer, sizeof answer);
    if (is_ipv4) end += static_cast<ssize_t>(sizeof answer);
    (void)!sendto(descriptor, packet, static_cast<size_t>(end), 0,
                  reinterpret_cast<const sockaddr*>(&from), from_size);
  }
}

bool bringUpLoopback() {
  const int descriptor = socket(AF_INET, SOCK_DGRAM, 0);
  ifreq request = {};
  memcpy(request.ifr_name, "lo", 3);
  request.ifr_flags = IFF_UP;
  const bool done = ioctl(descriptor, SIOCSIFFLAGS, &request) == 0;
  close(descriptor);
  return done;
}

TEST_P(Storm, HostsAreFoundThroughASlowNameServer) {
  REQUIRE_ROOT("for a name server of its own");
  EXPECT_EQ(withPrivateNetwork([&] {
              writeFile("/etc/hosts", "");
              writeFile("/etc/nsswitch.conf", "passwd: files\ngroup: files\nhosts: dns\n");
              writeFile("/etc/resolv.conf", "nameserver 127.0.0.1\n");
              if (!bringUpLoopback() || sethostname("storm.test", 10) != 0) return 2;
              const int server = socket(AF_INET, SOCK_DGRAM, 0);
              sockaddr_in address = {};
              address.sin_family = AF_INET;
              address.sin_port = htons(53);
              address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
              if (bind(server, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
                return 3;
              }
              const pid_t names = fork();
              if (names == 0) {
                (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
                serveNames(server);
              }
              const int result = stormy([] {
                char** list = nullptr;
                int count = 0;
                EXPECT_EQ(getAllIPAddresses(&list, &count), 0);
                ASSERT_EQ(count, 1);
                EXPECT_STREQ(list[0], "192.0.2.1");
                free(list[0]);
                free(static_cast<void*>(list));
                hostent* entry = nullptr;
                int size = 0;
                EXPECT_EQ(vra_gethostbyname("other.test", &entry, &size), OSUTILS_SUCCESS);
                ASSERT_NE(entry, nullptr);
                EXPECT_EQ(memcmp(entry->h_addr_list[0], "\xc0\0\2\1", 4), 0);
                free(entry);
              });
              kill(names, SIGKILL);
              waitpid(names, nullptr, 0);
              return result;
            }),
            0);
  expectTrace();
}

}  // namespace
