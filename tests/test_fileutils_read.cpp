#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "faults.h"
#include "osutils.h"
#include "test_fileutils.h"
#include "trails.h"
#include "world.h"

namespace {

TRACED_AND_NOT(ReadFile);

TEST_P(ReadFile, RefusesANullPath) {
  char* out = untouched;
  EXPECT_FALSE(readFile(nullptr, &out));
  EXPECT_EQ(trail(), traced(call("readFile", 0, debugLine("readFile: passed a null pointer."))));
  EXPECT_EQ(out, untouched);
}

TEST_P(ReadFile, ReadsEveryByteIntoABufferOfTheCallers) {
  const int open_before = openDescriptors();
  const size_t sizes[] = {1, 7, 4096, 65537, (1 << 20) + 3};
  for (const size_t size : sizes) {
    SCOPED_TRACE(size);
    std::string contents = randomBytes(size);
    contents[size / 2] = '\0';
    const std::string path = temp_.file("file", contents);
    const LiveAllocations live;
    char* out = nullptr;

    EXPECT_TRUE(readFile(path.c_str(), &out));

    if (!sanitizerOwnsMalloc()) {
      EXPECT_EQ(live.blocks(), 1);
    }
    const Buffer buffer(out);
    EXPECT_EQ(trail(), traced(call("readFile", 1, no("isDirectory"))));
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(memcmp(out, contents.data(), size), 0);
  }
  EXPECT_EQ(openDescriptors(), open_before);
}

TEST_P(ReadFile, ReadsWithTheOnlyFreeDescriptorAlsoThatOfAStandardStream) {
  const std::string path = temp_.file("file", "contents");
  EXPECT_EQ(inChild([&] {
              rlimit limit;
              EXPECT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
              const int first_free = dup(STDIN_FILENO);
              close(first_free);
              const rlimit none_free = {static_cast<rlim_t>(first_free), limit.rlim_max};
              EXPECT_EQ(setrlimit(RLIMIT_NOFILE, &none_free), 0);
              close(STDIN_FILENO);
              char* out = nullptr;
              EXPECT_TRUE(readFile(path.c_str(), &out));
              const Buffer buffer(out);
              EXPECT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
              EXPECT_EQ(fcntl(STDIN_FILENO, F_GETFD), -1);
              return 0;
            }),
            0);
}

TEST_P(ReadFile, GivesABufferForAnEmptyFileToo) {
  const std::string path = temp_.file("empty", "");
  char* out = nullptr;
  EXPECT_TRUE(readFile(path.c_str(), &out));
  EXPECT_NE(out, nullptr);
  free(out);
}

TEST_P(ReadFile, FollowsALink) {
  makeLink(temp_.file("target", "text"), temp_.path("link"));
  char* out = nullptr;
  ASSERT_TRUE(readFile(temp_.path("link").c_str(), &out));
  EXPECT_EQ(std::string(out, 4), "text");
  free(out);
}

TEST_P(ReadFile, FailsOnADirectoryAndASocketAndTouchesNothing) {
  makeSocket(temp_.path("socket"));
  for (const std::string& path : {temp_.path(), temp_.path("socket")}) {
    SCOPED_TRACE(path);
    char* out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));
    EXPECT_EQ(trail(), traced(call("readFile", 0, yes("isDirectory"))));
    EXPECT_EQ(out, untouched);
  }
}

TEST_P(ReadFile, FailsWithoutAMessageWhenTheFileCannotBeOpened) {
  const std::pair<std::string, int> cases[] = {
      {temp_.path("missing"), ENOENT},
      {"", ENOENT},
      {temp_.file("file", "text") + "/below", ENOTDIR},
      {"/" + std::string(5000, 'p'), ENAMETOOLONG},
  };
  for (const auto& [path, reason] : cases) {
    SCOPED_TRACE(path);
    char* out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));
    EXPECT_EQ(trail(), traced(call("readFile", 0, query("isDirectory", 0, reason))));
    EXPECT_EQ(out, untouched);
  }
  const FailingCall opened(Call::fopen64, EMFILE);
  char* out = untouched;
  EXPECT_FALSE(readFile(temp_.path("file").c_str(), &out));
  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
  EXPECT_EQ(out, untouched);
}

TEST_P(ReadFile, FailsWhereReadingIsRefused) {
  const std::string path = temp_.file("file", "text");
  const Permissions unreadable(path, 0);
  EXPECT_EQ(asOrdinaryUser([&] {
              char* out = untouched;
              EXPECT_FALSE(readFile(path.c_str(), &out));
              EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
              EXPECT_EQ(out, untouched);
              return 0;
            }),
            0);
}

TEST_P(ReadFile, WithoutMemoryGivesNullAndLeavesTheStreamOpen) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  const int open_before = openDescriptors();
  const LiveAllocations live;
  const FailingCall allocation(Call::calloc, ENOMEM);
  char* out = untouched;

  EXPECT_FALSE(readFile(path.c_str(), &out));

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(trail(), traced(call("readFile", 0, no("isDirectory"))));
  EXPECT_EQ(out, nullptr);
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(openDescriptors(), open_before + 1);
  EXPECT_TRUE(isOpenHere(path));
}

TEST_P(ReadFile, TakesTheSizeAsASigned32BitNumber) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "beginning");
  ASSERT_EQ(truncate(path.c_str(), (off_t{1} << 32) + 9), 0);
  char* out = nullptr;
  ASSERT_TRUE(readFile(path.c_str(), &out));
  EXPECT_EQ(std::string(out, 9), "beginning");
  free(out);

  for (const off_t negative : {off_t{1} << 31, (off_t{1} << 32) - 1}) {
    ASSERT_EQ(truncate(path.c_str(), negative), 0);
    out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));  // too large to allocate
    EXPECT_EQ(out, nullptr);
  }
}

TEST_P(ReadFile, OfAPipeFindsNoSizeAndNoMemoryForIt) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.path("fifo");
  makeFifo(path);
  PipeWriter writer(path, "text");
  char* out = untouched;
  EXPECT_FALSE(readFile(path.c_str(), &out));
  EXPECT_TRUE(writer.allWasTaken());
  EXPECT_EQ(out, nullptr);
}

TEST_P(ReadFile, FailsIfTheSizeCannotBeFound) {
  REQUIRE_OWN_MALLOC();
  const std::string path = temp_.file("file", "text");
  for (const Call call : {Call::fseeko64, Call::ftello64}) {
    const int open_before = openDescriptors();
    const FailingCall seeking(call, EIO);
    char* out = untouched;
    EXPECT_FALSE(readFile(path.c_str(), &out));
    ASSERT_TRUE(seeking.fired());
    EXPECT_EQ(out, nullptr);
    // A size of -1 is one that cannot be allocated.
    EXPECT_EQ(openDescriptors(), open_before + (call == Call::ftello64 ? 1 : 0));
  }
}

TEST_P(ReadFile, OfAFileInProcIsEmpty) {
  char* out = nullptr;
  ASSERT_TRUE(readFile("/proc/self/mounts", &out));
  EXPECT_NE(out, nullptr);
  free(out);
}

TEST_P(ReadFile, ReadsAsZerosWhatCannotBeRead) {
  const std::string path = temp_.file("file", "text");
  const FailingCall reading(Call::fread, EIO);
  char* out = nullptr;

  ASSERT_TRUE(readFile(path.c_str(), &out));

  ASSERT_TRUE(reading.fired());
  EXPECT_EQ(std::string(out, 4), std::string(4, '\0'));
  free(out);
}

TEST_P(ReadFile, IgnoresAFailedClose) {
  const std::string path = temp_.file("file", "text");
  const FailingCall closing(Call::fclose, EIO);
  char* out = nullptr;
  ASSERT_TRUE(readFile(path.c_str(), &out));
  ASSERT_TRUE(closing.fired());
  EXPECT_EQ(std::string(out, 4), "text");
  free(out);
}

TEST_P(ReadFile, DiesOfANullOutPointer) {
  const std::string path = temp_.file("file", "text");
  char** volatile none = nullptr;
  EXPECT_DEATH((void)readFile(path.c_str(), none), "");
}

}  // namespace
