// Loads and unloads libosutils.so again and again. This program is not linked with it.

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <stdlib.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>

#include "world.h"

namespace {

constexpr int kTimes = 10'000;

// Returns the number that /proc/self/status has under the name.
long statusOf(const std::string& name) {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with(name + ":")) return std::stol(line.substr(name.size() + 1));
  }
  ADD_FAILURE() << name;
  return -1;
}

long mappings() {
  std::ifstream maps("/proc/self/maps");
  return std::count(std::istreambuf_iterator<char>(maps), {}, '\n');
}

// Its first use allocates memory for good.
struct Resources {
  long allocated = static_cast<long>(mallinfo2().uordblks);
  long resident_kib = statusOf("RssAnon");
  long threads = statusOf("Threads");
  long mapped = mappings();
  int descriptors = openDescriptors();
};

template <typename Function>
Function* functionOf(void* library, const char* name) {
  auto* const function = reinterpret_cast<Function*>(dlsym(library, name));
  EXPECT_NE(function, nullptr) << name;
  return function;
}

// Loads the library, calls the body with it and unloads it.
template <typename Body>
void whileLoaded(Body body) {
  void* const library = dlopen(OSUTILS_LIBRARY, RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(library, nullptr) << dlerror();
  body(library);
  ASSERT_EQ(dlclose(library), 0);
  ASSERT_EQ(dlopen(OSUTILS_LIBRARY, RTLD_NOW | RTLD_NOLOAD), nullptr);
}

class Unloading : public testing::TestWithParam<bool> {
 protected:
  void SetUp() override {
#ifdef SANITIZER_OWNS_MALLOC
    GTEST_SKIP()
        << "a sanitizer keeps memory for each library, and cannot name what an unloaded one leaks";
#endif
  }

  // Runs the body in a child process, traced or not: the platform libraries read the environment when they are loaded.
  void inProcess(const std::function<void()>& body) const {
    EXPECT_EQ(inChild([&] {
                if (GetParam()) {
                  setenv("TRC_DIR", temp_.path("traces").c_str(), 1);
                  setenv("TRC_EVENTS", "all", 1);
                  setenv("PRINT_DEBUG", "all", 1);
                  setenv("PRINT_DEBUG_FILE", temp_.path("printed").c_str(), 1);
                }
                body();
                return 0;
              }),
              0);
    EXPECT_EQ(pathExists(temp_.path("traces")), GetParam());
    EXPECT_EQ(pathExists(temp_.path("printed")), GetParam());
  }

  const TempDir temp_;
};

INSTANTIATE_TEST_SUITE_P(Tracing, Unloading, testing::Bool(), [](const auto& tested) {
  return std::string(tested.param ? "On" : "Off");
});

TEST_P(Unloading, LeavesNothing) {
  inProcess([] {
    const auto use = [](void* library) {
      EXPECT_TRUE(functionOf<bool(const char*)>(library, "doesFileExist")("/"));
      EXPECT_FALSE(functionOf<bool(const char*)>(library, "doesFileExist")(nullptr));
      free(functionOf<char*()>(library, "getTempDir")());
    };
    (void)Resources();
    for (int i = 0; i < 100; ++i) whileLoaded(use);
    const Resources before;
    for (int i = 0; i < kTimes; ++i) whileLoaded(use);
    const Resources after;
    EXPECT_EQ(after.descriptors, before.descriptors);
    EXPECT_LT(after.mapped, before.mapped + 3);  // the kernel splits and merges mappings
    EXPECT_EQ(after.threads, before.threads);
    EXPECT_EQ(after.allocated, before.allocated);
    EXPECT_LT(after.resident_kib, before.resident_kib + 64);
  });
}

// The leaks that programs expect, and no more.
TEST_P(Unloading, LeavesTheRequiredLeaks) {
  static constexpr int kCalls = 100;
  inProcess([] {
    const auto use = [](void* library) {
      free(functionOf<char*(const char*)>(library, "getVRABaseSchemaDirPath")("3"));
    };
    // Large, so that blocks in the allocator's caches do not matter.
    const std::string root = "/" + std::string(3999, 'r');
    const long block_bytes = 4016;  // the allocator's, for the root and its NUL
    setenv("VRA_LDAP_HOME", root.c_str(), 1);
    (void)Resources();
    for (int i = 0; i < kCalls; ++i) whileLoaded(use);
    const Resources before;
    for (int i = 0; i < kCalls; ++i) whileLoaded(use);
    EXPECT_EQ((Resources().allocated - before.allocated) / block_bytes, kCalls);

    const auto open_socket = [](void* library) {
      char** list = nullptr;
      int count = 0;
      alignas(8) char scratch[16];
      if (functionOf<int(char***, int*, void*)>(library, "getAllIPAddresses_Linux")(&list, &count,
                                                                                    scratch) != 0) {
        return;
      }
      for (char** entry = list; *entry != nullptr; ++entry) free(*entry);
      free(static_cast<void*>(list));
    };
    whileLoaded(open_socket);
    const int descriptors = openDescriptors();
    for (int i = 0; i < kCalls; ++i) whileLoaded(open_socket);
    EXPECT_EQ(openDescriptors(), descriptors + kCalls);
  });
}

}  // namespace
