// Every exported function in a thread with the smallest stack that the header allows, with the real
// shared objects, all events traced and all messages printed.
//
// The test starts itself once for each call: the switches are read when a program starts, and a
// stack overflow may end the process. Below the stack is memory that nothing else writes to.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ldtr.h>
#include <osutils.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "exported_calls.h"
#include "world.h"

using testing::IsEmpty;

namespace {

constexpr size_t kSmallStackBytes = size_t{16} * 1024;
constexpr size_t kBelowBytes = size_t{1024} * 1024;
constexpr unsigned char kUntouched = 0xA5;

enum Result { kRight = 0, kWrong = 1, kRanOver = 2, kNoThread = 3 };

struct ThreadRun {
  const std::function<bool()>* body;
  bool right;
};

extern "C" void* runThread(void* argument) {
  auto& run = *static_cast<ThreadRun*>(argument);
  run.right = (*run.body)();
  return nullptr;
}

size_t stackBytes() {
  const long least = sysconf(_SC_THREAD_STACK_MIN);
  return std::max(kSmallStackBytes, least > 0 ? static_cast<size_t>(least) : 0);
}

// Runs the body in a thread and measures the thread's stack.
Result runOnSmallStack(const std::function<bool()>& body) {
  const size_t size = stackBytes();
  void* const memory =
      mmap(nullptr, kBelowBytes + size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (memory == MAP_FAILED) return kNoThread;
  memset(memory, kUntouched, kBelowBytes + size);
  auto* const bottom = static_cast<unsigned char*>(memory);

  pthread_attr_t attributes;
  pthread_t thread;
  ThreadRun run{&body, false};
  if (pthread_attr_init(&attributes) != 0 ||
      pthread_attr_setstack(&attributes, bottom + kBelowBytes, size) != 0 ||
      pthread_create(&thread, &attributes, runThread, &run) != 0 ||
      pthread_join(thread, nullptr) != 0) {
    return kNoThread;
  }
  const unsigned char* const top = bottom + kBelowBytes + size;
  const unsigned char* const deepest = std::find_if(
      bottom, bottom + kBelowBytes + size, [](unsigned char byte) { return byte != kUntouched; });
  printf("%zu of %zu bytes\n", static_cast<size_t>(top - deepest), size);
  if (deepest < bottom + kBelowBytes) return kRanOver;
  return run.right ? kRight : kWrong;
}

// Paths of the functions and of the platform libraries that need more stack than the usual ones.
std::vector<ExportedCall> allCalls(const std::string& directory) {
  std::vector<ExportedCall> calls = exportedCalls(directory);
  const auto add = [&](const char* name, std::function<bool()> body) {
    calls.push_back({{name}, Enters::kNothing, std::move(body)});
  };
  static std::string in;
  in = directory;
  add("AMessageOfTheCatalogue", [] {
    g_isCallerVraImigr = 1;
    g_migBackDir = in.c_str();
    char* version = nullptr;
    char* const path = getXQ4PathAndVersion(&version);
    return path == nullptr && version == nullptr;
  });
  add("ATextOfManyLines", [] {
    static const std::string name(4000, 'n');
    return checkFilePerms(name.c_str()) == OSUTILS_NO_SUCH_OBJECT;
  });
  add("AWaitForALock", [] {
    static pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
    static std::atomic<bool> is_held = false;
    std::thread holder([] {
      (void)pthread_mutex_lock(&mutex);
      is_held = true;
      (void)usleep(50'000);
      (void)pthread_mutex_unlock(&mutex);
    });
    while (!is_held) {
    }
    { const AutoLock lock(&mutex, true); }
    holder.join();
    return true;
  });
  add("ADeletionThatFails", [] {
    static const std::string backup = in + "/etc";
    VRAOSUtils::EtcServices::ETC_SERVICES_FILE_BACKUP = backup.c_str();
    VRAOSUtils::EtcServices list;
    return list.readEtcServices() == OSUTILS_SUCCESS &&
           list.deleteService("web") == OSUTILS_INSUFFICIENT_ACCESS;
  });
  add("ACopyOfAFileWithoutASize", [] {
    static std::string copy = in + "/copy";
    return copyFile("/proc/self/mounts", copy.data(), nullptr, nullptr, 0600);
  });
  return calls;
}

constexpr const char kCallOption[] = "--call=";

class SmallStack : public testing::TestWithParam<size_t> {};

TEST_P(SmallStack, IsEnough) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer's code needs a stack of its own size";
#endif
  const TempDir temp;
  const std::string calls = temp.dir("calls");
  const ExportedCall call = allCalls(calls)[GetParam()];
  if (call.enters != Enters::kNothing) {
    GTEST_SKIP() << "it enters the resolver, a shell or the account database";
  }
  const std::string traces = temp.path("traces");
  const std::string printed = temp.path("printed");
  prepareCalls(calls);
  writeFile(calls + "/etc/xq4info", "currentXQ4InstallPath=/opt/xq4\ncurrentXQ4Version=9.x\n");
  const std::string command =
      "TRC_DIR='" + traces + "' TRC_EVENTS=all PRINT_DEBUG=all " + "PRINT_DEBUG_FILE='" + printed +
      "' '" + std::filesystem::read_symlink("/proc/self/exe").string() + "' " + kCallOption +
      std::to_string(GetParam()) + " '" + calls + "' >'" + temp.path("out") + "' 2>&1";

  const int status = system(command.c_str());

  ASSERT_TRUE(WIFEXITED(status)) << status;
  EXPECT_EQ(WEXITSTATUS(status), kRight) << contentsOf(temp.path("out"));
  RecordProperty("stack", contentsOf(temp.path("out")));
  EXPECT_TRUE(pathExists(printed));
}

std::string nameOf(const testing::TestParamInfo<size_t>& info) {
  std::string name = allCalls("")[info.param].symbols.front();
  std::erase(name, '*');
  return name;
}

INSTANTIATE_TEST_SUITE_P(Of, SmallStack, testing::Range(size_t{0}, allCalls("").size()), nameOf);

TEST(EveryExportedFunction, IsCalledOnASmallStack) {
  EXPECT_THAT(symbolsWithoutCall(exportedCalls("")), IsEmpty());
}

TEST(TheMeasure, SeesAThreadThatRunsOverItsStack) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "a sanitizer's code needs a stack of its own size";
#endif
  const std::function<bool()> body = [] {
    volatile char block[size_t{64} * 1024];
    block[0] = 1;
    return block[0] == 1;
  };
  EXPECT_EQ(runOnSmallStack(body), kRanOver);
}

}  // namespace

int main(int argc, char** argv) {
  const size_t option = strlen(kCallOption);
  if (argc == 3 && strncmp(argv[1], kCallOption, option) == 0) {
    const auto calls = allCalls(argv[2]);
    useCalls(argv[2]);
    return runOnSmallStack(calls.at(std::stoul(argv[1] + option)).body);
  }
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
