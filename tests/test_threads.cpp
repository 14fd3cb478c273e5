// Eight threads call every function that may be called from several threads, on shared and on own
// objects, with the real shared objects, while another thread switches the events of the trace,
// moves the trace to other directories and has the configuration read again.
//
// Messages are printed to a file. Its name is read when the library is loaded, so the program starts
// itself once more.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldap_clientosutils.h>
#include <ldtr.h>
#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <barrier>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <random>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "calls_of_threads.h"
#include "test_libtrc.h"
#include "world.h"

using testing::AnyOf;
using testing::Each;
using testing::IsEmpty;
using testing::SizeIs;
using testing::UnorderedElementsAreArray;
using VRAOSUtils::EtcInittab;
using VRAOSUtils::EtcServices;

namespace {

constexpr int kThreads = 8;
constexpr uint64_t kAllEvents = 0x4033000;

// Exported functions that several threads may not call at once. The header says why.
const std::map<std::string, const char*> kLeftOut = {
    {"putEnvVar", "no other thread may use the environment during the call"},
};

int printed_file = -1;  // what the library prints

// Runs the body in that many threads, which begin together.
void inThreads(int count, const std::function<void(int)>& body) {
  std::barrier start(count);
  std::vector<std::thread> threads;
  for (int thread = 0; thread < count; ++thread) {
    threads.emplace_back([&, thread] {
      start.arrive_and_wait();
      body(thread);
    });
  }
  for (std::thread& thread : threads) thread.join();
}

void allowDescriptors(rlim_t count) {
  rlimit limit = {};
  (void)getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = std::min(count, limit.rlim_max);
  (void)setrlimit(RLIMIT_NOFILE, &limit);
}

// What a program may change while other threads call. The two variables are plain integers to it.
class Settings {
 public:
  Settings(CallsOfThreads& calls, std::string directory)
      : calls_(calls), directory_(std::move(directory)) {}

  void flip() {
    constexpr uint64_t kMasks[] = {0, 0x1000, kAllEvents, 0x4000000, 0x22000, 0x33000, kAllEvents};
    trcEvents = kMasks[flips_++ % std::size(kMasks)];
    configfile_read++;
    if (read_ldap_debug() != 1) wrong_ = true;
  }

  void move() {
    const std::string number = std::to_string(moves_++);
    const std::string trace = directory_ + "/" + number;
    calls_.withoutCalls([&] {
      (void)setenv("TRC_DIR", trace.c_str(), 1);
      (void)setenv("AUTOLOCKTYPE", ("TIMED" + number).c_str(), 1);
    });
    if (trcInit() != 0) wrong_ = true;
  }

  bool wrong() const { return wrong_; }

 private:
  CallsOfThreads& calls_;
  std::string directory_;
  size_t flips_ = 0;
  int moves_ = 0;
  bool wrong_ = false;
};

constexpr int kMoves = 30;

// How often each call is made. A shell takes long, and so does an edit, which is forced to the disk.
int roundsOf(const ExportedCall& call) {
  const bool is_slow =
      call.enters == Enters::kShell || call.meanwhile == Meanwhile::kNoUseOfEditedFiles;
  return is_slow ? 3 : 30;
}

// The functions of calls that are made in each thread, as often as roundsOf() says, and that were
// wrong at least once.
std::set<std::string> wrongCalls(CallsOfThreads& calls, Settings& settings,
                                 const std::function<bool(const ExportedCall&)>& is_made) {
  std::vector<size_t> order;
  const std::vector<ExportedCall>& all = calls.of(0);
  for (size_t i = 0; i < all.size(); ++i) {
    if (is_made(all[i])) order.insert(order.end(), static_cast<size_t>(roundsOf(all[i])), i);
  }
  std::atomic<size_t> made = 0;
  std::atomic<int> ended = 0;
  std::barrier all_traced(kThreads + 1);
  std::mutex mutex;
  std::set<std::string> wrong;
  inThreads(kThreads + 1, [&](int thread) {
    if (thread == kThreads) {
      const size_t all_calls = order.size() * kThreads;
      for (size_t moves = 0; ended < kThreads || moves < kMoves;) {
        settings.flip();
        if (moves < kMoves && made * kMoves >= moves * all_calls) {
          settings.move();
          ++moves;
        }
        (void)usleep(100);
      }
      trcEvents = kAllEvents;
      all_traced.arrive_and_wait();
      return;
    }
    const auto worker = static_cast<size_t>(thread);
    std::vector<size_t> own_order = order;
    std::shuffle(own_order.begin(), own_order.end(), std::minstd_rand(1 + worker));
    for (const size_t i : own_order) {
      const ExportedCall& call = calls.of(worker)[i];
      if (!calls.make(worker, call)) {
        const std::lock_guard lock(mutex);
        wrong.insert(call.symbols.front());
      }
      made.fetch_add(1, std::memory_order_relaxed);
    }
    ++ended;
    all_traced.arrive_and_wait();
    (void)checkFilePerms(nullptr);  // leaves records and a message
  });
  return wrong;
}

// Returns the threads that left records in the traces below a directory.
std::set<unsigned long> threadsInTraces(const std::string& directory) {
  std::set<unsigned long> found;
  for (const fs::path& trace : entries(directory)) {
    for (const Event& event : readEvents(trace)) found.insert(event.tid);
  }
  return found;
}

std::string readPrinted() {
  std::string text(static_cast<size_t>(std::max<off_t>(lseek(printed_file, 0, SEEK_END), 0)), '\0');
  const ssize_t length = pread(printed_file, text.data(), text.size(), 0);
  text.resize(static_cast<size_t>(std::max<ssize_t>(length, 0)));
  return text;
}

// Returns the threads that have printed. Each line must be a whole one.
std::set<std::string> threadsInPrint() {
  static const std::regex whole(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z \d+ (\d+) [ -~]*)");
  std::set<std::string> found;
  std::istringstream lines(readPrinted());
  for (std::string line; std::getline(lines, line);) {
    std::smatch parts;
    EXPECT_TRUE(std::regex_match(line, parts, whole)) << line;
    if (!parts.empty()) found.insert(parts[1]);
  }
  return found;
}

bool isMade(const ExportedCall& call) { return !kLeftOut.contains(call.symbols.front()); }

// In a child process.
int callWhileSettingsChange(const std::function<bool(const ExportedCall&)>& is_made) {
  allowDescriptors(4096);  // some functions leave a socket open
  const TempDir temp;
  const std::string traces = temp.dir("traces");
  CallsOfThreads calls(temp.dir("calls"), kThreads);
  Settings settings(calls, traces);
  settings.move();

  EXPECT_THAT(wrongCalls(calls, settings, is_made), IsEmpty());

  EXPECT_FALSE(settings.wrong());
  __atomic_store_n(&trcEvents, 0, __ATOMIC_RELAXED);
  EXPECT_THAT(entries(traces), SizeIs(kMoves + 1));
  EXPECT_GE(threadsInTraces(traces).size(), kThreads);
  EXPECT_GE(threadsInPrint().size(), kThreads);
  return 0;
}

TEST(EveryFunction, IsRightInEightThreadsWhileTheSettingsChange) {
  EXPECT_EQ(inChild([] {
              return callWhileSettingsChange([](const ExportedCall& call) {
                return isMade(call) && call.enters != Enters::kResolver;
              });
            }),
            0);
}

TEST(EveryFunction, ThatEntersTheResolverIsRightInEightThreads) {
  REQUIRE_ROOT("for hosts of its own");
  EXPECT_EQ(withPrivateNetwork([] {
              writeFile("/etc/hosts", "127.0.0.1 localhost\n");
              return callWhileSettingsChange([](const ExportedCall& call) {
                return isMade(call) && call.enters == Enters::kResolver;
              });
            }),
            0);
}

TEST(EveryFunction, IsCalledOrLeftOutWithAReason) {
  const TempDir temp;
  std::vector<ExportedCall> calls = exportedCalls(temp.path());
  std::erase_if(calls, [](const ExportedCall& call) { return !isMade(call); });
  std::vector<std::string> left_out;
  for (const auto& [symbol, reason] : kLeftOut) left_out.push_back(symbol);
  EXPECT_THAT(symbolsWithoutCall(calls), UnorderedElementsAreArray(left_out));
}

// ---- First calls ----

TEST(FirstCalls, MadeAtOnceAreRight) {
  EXPECT_EQ(inChild([] {
              std::atomic<int> right = 0;
              inThreads(kThreads, [&](int) {
                constexpr long kMinute = 60'000;
                const bool nptl = isNPTL();
                const long elapsed = current_time_in_milliseconds();
                if (nptl && elapsed > -kMinute && elapsed < kMinute && vra_get_uid("root") == 0) {
                  ++right;
                }
              });
              EXPECT_EQ(right, kThreads);
              return 0;
            }),
            0);
}

// ---- Shared objects ----

TEST(SharedMutex, IsHeldByOneAutoLockAtATime) {
  EXPECT_EQ(inChild([] {
              constexpr int kRounds = 2000;
              static char name[] = "AUTOLOCKTYPE";
              (void)putEnvVar(name, "REGULARLOCK");
              pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
              int count = 0;
              inThreads(kThreads, [&](int thread) {
                for (int i = 0; i < kRounds; ++i) {
                  const AutoLock lock(&mutex, thread % 2 == 0);
                  ++count;
                }
              });
              EXPECT_EQ(count, kRounds * kThreads);
              return 0;
            }),
            0);
}

TEST(SharedBuffer, IsTheSameForEachThread) {
  const AutoFree<char> owner(strdup("text"), free);
  std::atomic<int> right = 0;
  inThreads(kThreads, [&](int) {
    for (int i = 0; i < 1000; ++i) right += strcmp(owner.get(), "text") == 0;
  });
  EXPECT_EQ(right, kThreads * 1000);
}

TEST(SharedLibrary, IsSearchedByManyThreads) {
  SharedLibHandle* const library = loadSharedLib("libanl.so.1", 0);
  ASSERT_NE(library, nullptr);
  std::atomic<int> right = 0;
  inThreads(kThreads, [&](int) {
    for (int i = 0; i < 1000; ++i) {
      right += getSymAddress(library, "gai_cancel") != nullptr;
      right += getSymAddress(library, "no such symbol") == nullptr;
    }
  });
  EXPECT_EQ(right, kThreads * 2000);
  EXPECT_EQ(unloadSharedLib(library), OSUTILS_SUCCESS);
}

TEST(SharedScope, OfCodeWithoutAnIdIsUsedByManyThreads) {
  EXPECT_EQ(inChild([] {
              trcEvents = LDTR_EVENT_DEBUG;
              std::atomic<int> right = 0;
              inThreads(kThreads, [&](int thread) {
                for (int i = 0; i < 500; ++i) {
                  right += ldtr_fun.SetErrorCode(thread) == thread;
                  ldtr_fun(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ORDINARY, "thread %d\n", thread);
                  right += getAllIPAddresses_TVX() == 0;
                }
              });
              EXPECT_EQ(right, kThreads * 1000);
              return 0;
            }),
            0);
}

TEST(SharedArguments, AreOnlyRead) {
  const TempDir temp;
  std::string file = temp.file("file", "text");
  std::string dn = "cn = a ; o = x";
  std::string address = "10.0.0.1";
  char* addresses[] = {address.data(), nullptr};
  char* arguments[] = {file.data(), dn.data(), nullptr};
  std::string name = "inst1";
  std::atomic<int> wrong = 0;
  inThreads(kThreads, [&](int) {
    for (int i = 0; i < 300; ++i) {
      const std::unique_ptr<char, decltype(&free)> canonical(formatDn(dn.data()), free);
      wrong += canonical == nullptr || strcmp(canonical.get(), "CN=A,O=X") != 0;
      wrong += !compareDns(dn.data(), canonical.get());
      wrong += !isValidIPAddressInList(address.data(), addresses, 1);
      wrong += !checkOptionsForMetaChars(1, arguments);
      wrong += !isValidName(name.data());
      char* text = nullptr;
      wrong += !readFile(file.c_str(), &text) || memcmp(text, "text", 4) != 0;
      free(text);
      wrong += !isFile(file.data()) || !canWriteToFile(file.data());
      wrong += checkFilePerms(file.c_str()) != OSUTILS_SUCCESS;
    }
  });
  EXPECT_EQ(wrong, 0);
}

// "An object belongs to one thread at a time": each thread uses it in turn.
TEST(HandedOverObjects, WorkInEachThread) {
  const TempDir temp;
  const std::string services_file = temp.file("services", "web 80/tcp\n");
  const std::string inittab_file = temp.file("inittab", "x:2:respawn:/bin/false\n");
  EXPECT_EQ(inChild([&] {
              EtcServices::ETC_SERVICES_FILE = services_file.c_str();
              EtcInittab::ETC_INITTAB_FILE = inittab_file.c_str();
              EtcServices services;
              EtcInittab inittab;
              std::mutex mutex;
              int wrong = 0;
              inThreads(kThreads, [&](int thread) {
                const std::string service = "service" + std::to_string(thread);
                const std::string id = "t" + std::to_string(thread);
                for (int i = 0; i < 20; ++i) {
                  const std::lock_guard lock(mutex);
                  wrong += services.readEtcServices() != OSUTILS_SUCCESS;
                  wrong += inittab.readInittab() != OSUTILS_SUCCESS;
                  const bool added = services.doesServiceExist(service.c_str());
                  wrong += added != (i > 0);
                  if (added) continue;
                  wrong += services.addService(service.c_str(), 1000 + thread) != OSUTILS_SUCCESS;
                  wrong += inittab.addInittabEntry(id.c_str(), "2", "once", "/bin/true") !=
                           OSUTILS_SUCCESS;
                }
              });
              EXPECT_EQ(wrong, 0);
              EXPECT_EQ(services.findAvaliablePort(1000), 1000 + kThreads);
              return 0;
            }),
            0);
}

// ---- Shared files ----

// Each operation can succeed only once. Returns how many threads it succeeded for.
int successes(const std::function<bool()>& operation) {
  std::atomic<int> count = 0;
  inThreads(kThreads, [&](int) { count += operation(); });
  return count;
}

TEST(SharedNames, AreMadeAndRemovedByOneThread) {
  const TempDir temp;
  std::string directory = temp.path("directory");
  const std::string link = temp.path("link");
  std::string file = temp.path("file");
  for (int round = 0; round < 30; ++round) {
    writeFile(file, "text");
    EXPECT_EQ(successes([&] { return createDirectory(directory.data(), nullptr, nullptr, 0700); }),
              1);
    EXPECT_EQ(successes([&] { return createSymLink("file", link.c_str()) == 0; }), 1);
    EXPECT_EQ(successes([&] { return deleteDirectory(directory.c_str()); }), 1);
    EXPECT_EQ(successes([&] { return removeSymLink(link.c_str()) == 0; }), 1);
    EXPECT_EQ(successes([&] { return deleteFile(file.data()); }), 1);
  }
}

TEST(SharedFile, IsQueriedWhileItComesAndGoes) {
  const TempDir temp;
  std::string file = temp.path("file");
  const std::string source = temp.file("source", "text");
  std::atomic<bool> over = false;
  std::atomic<int> wrong = 0;
  inThreads(kThreads, [&](int thread) {
    if (thread == 0) {
      for (int i = 0; i < 200; ++i) {
        wrong += !createFile(file.data(), nullptr, nullptr, 0600);
        wrong += !copyFile(source.c_str(), file.data(), nullptr, nullptr, 0600);
        wrong += !deleteFile(file.data());
      }
      over = true;
      return;
    }
    while (!over) {
      (void)doesFileExist(file.c_str());
      (void)isFile(file.data());
      wrong += !canAccessFile(file.c_str()) || isDirectory(file.c_str());
      const int code = checkFilePerms(file.c_str());
      wrong += code != OSUTILS_SUCCESS && code != OSUTILS_NO_SUCH_OBJECT;
      char* text = nullptr;
      (void)readFile(file.c_str(), &text);
      free(text);
      char* owner = nullptr;
      char* group = nullptr;
      unsigned int mode = 0;
      (void)getFileOwnersAndPermissions(file.c_str(), &owner, &group, &mode);
      free(owner);
      free(group);
    }
  });
  EXPECT_EQ(wrong, 0);
}

// Unlocked edits may lose each other's changes, but nothing else.
TEST(SharedFile, IsEditedByManyThreadsWithoutHarmToTheProcess) {
  const TempDir temp;
  const std::string services_file = temp.file("services", "web 80/tcp\n");
  const std::string services_backup = temp.path("services.b");
  const std::string inittab_file = temp.file("inittab", "x:2:respawn:/bin/false\n");
  const std::string inittab_backup = temp.path("inittab.b");
  EXPECT_EQ(inChild([&] {
              EtcServices::ETC_SERVICES_FILE = services_file.c_str();
              EtcServices::ETC_SERVICES_FILE_BACKUP = services_backup.c_str();
              EtcInittab::ETC_INITTAB_FILE = inittab_file.c_str();
              EtcInittab::ETC_INITTAB_FILE_BACKUP = inittab_backup.c_str();
              const auto is_known =
                  AnyOf(OSUTILS_SUCCESS, OSUTILS_NO_SUCH_OBJECT, OSUTILS_INSUFFICIENT_ACCESS,
                        OSUTILS_UNAVAILABLE, OSUTILS_UNWILLING_TO_PERFORM, OSUTILS_ALREADY_EXISTS);
              std::mutex mutex;
              std::vector<int> codes;
              inThreads(kThreads, [&](int thread) {
                const std::string service = "service" + std::to_string(thread);
                const std::string id = "t" + std::to_string(thread);
                for (int i = 0; i < 20; ++i) {
                  EtcServices services;
                  EtcInittab inittab;
                  const int own[] = {services.readEtcServices(),
                                     services.addService(service.c_str(), 1000 + thread),
                                     services.deleteService(service.c_str()),
                                     inittab.readInittab(),
                                     inittab.addInittabEntry(id.c_str(), "2", "once", "/bin/true"),
                                     inittab.deleteInittabEntry(id.c_str())};
                  const std::lock_guard lock(mutex);
                  codes.insert(codes.end(), std::begin(own), std::end(own));
                }
              });
              EXPECT_THAT(codes, SizeIs(kThreads * 20 * 6));
              EXPECT_THAT(codes, Each(is_known));
              return 0;
            }),
            0);
}

// ---- The program ----

constexpr const char kPrinting[] = "--printing";

// Starts this program again with debug messages printed to a new file.
int startAgain(int argc, char** argv) {
  char directory[] = "/tmp/osutils-threads.XXXXXX";
  if (mkdtemp(directory) == nullptr) return 1;
  (void)setenv("PRINT_DEBUG", "all", 1);
  (void)setenv("PRINT_DEBUG_FILE", (std::string(directory) + "/printed").c_str(), 1);
  char printing[sizeof kPrinting];
  memcpy(printing, kPrinting, sizeof kPrinting);
  std::vector<char*> arguments = {argv[0], printing};
  arguments.insert(arguments.end(), argv + 1, argv + argc);
  arguments.push_back(nullptr);
  (void)execv("/proc/self/exe", arguments.data());
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2 || strcmp(argv[1], kPrinting) != 0) return startAgain(argc, argv);
  const std::string file = getenv("PRINT_DEBUG_FILE");
  printed_file = open(file.c_str(), O_RDONLY | O_CLOEXEC);
  (void)unlink(file.c_str());
  (void)rmdir(std::filesystem::path(file).parent_path().c_str());
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
