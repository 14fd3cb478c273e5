// The metadata of a trace and its directory: which names, numbers and times they have.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "platform.h"
#include "test_libtrc.h"
#include "test_libtrc_calls.h"
#include "test_libtrc_files.h"
#include "world.h"

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;

namespace {

constexpr uint64_t kSecond = 1'000'000'000;

std::string hex(uint64_t number) {
  char text[32];
  (void)snprintf(text, sizeof text, "0x%lx", static_cast<unsigned long>(number));
  return text;
}

std::string enumerators(const char* form) {
  const std::string form_name = form;
  const bool is_wide = form_name == "wide";
  const std::string numbers = [&](int bits) {
    return "size = " + std::to_string(is_wide ? 64 : bits) + "; align = " + (is_wide ? "64" : "1");
  }(26);
  std::string text = "typealias enum : integer { " + numbers + "; base = hex; } {\n";
  text +=
      "  \"entry\" = 0x3200000,\n"
      "  \"entry\" = 0x32a0000,\n"
      "  \"exit\" = 0x3210000,\n"
      "  \"exit\" = 0x32b0000,\n"
      "  \"exit_error\" = 0x30b0000,\n"
      "  \"exit_error\" = 0x30c0000,\n"
      "  \"debug\" = 0x3400000,\n"
      "  \"debug_error\" = 0x3070000\n";
  text += "} := " + form_name + "_type;\n";
  text += is_wide ? "typealias enum : integer { size = 64; align = 64; base = hex; } {\n"
                  : "typealias enum : integer { size = 32; align = 1; base = hex; } {\n";
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name)  \
  text += std::string("  \"") + name +                                            \
          "\" = " + hex(0x3E000000U + 65536 * module + 256 * ordinal) + " ... " + \
          hex(0x3E0000FFU + 65536 * module + 256 * ordinal) + ",\n";
#include "trace_functions.def"
#undef TRACE_FUNCTION
  text +=
      "  \"ldtr_fun\" = 0xc8010000 ... 0xc80100ff,\n"
      "  \"ldtr_fun\" = 0xc8110000 ... 0xc81100ff\n"
      "} := " +
      form_name + "_function;\n";
  return text;
}

constexpr const char kSmallEvents[] = R"(event {
  name = "record"; id = 0; stream_id = 0;
  fields := struct {
    small_type type; small_function function;
    integer { size = 11; align = 1; base = hex; } object;
  };
};
event {
  name = "return"; id = 1; stream_id = 0;
  fields := struct {
    small_type type; small_function function;
    integer { size = 1; align = 1; base = hex; } object;
    integer { size = 10; align = 1; signed = true; } code;
  };
};
event {
  name = "message"; id = 2; stream_id = 0;
  fields := struct {
    small_type type; small_function function;
    integer { size = 6; align = 1; base = hex; } object;
    integer { size = 32; align = 8; } length;
    integer { size = 8; align = 8; encoding = UTF8; } text[length];
  };
};
)";

constexpr const char kWideEvents[] = R"(event {
  name = "record"; id = 4; stream_id = 0;
  fields := struct {
    wide_type type; wide_function function;
    integer { size = 64; align = 64; base = hex; } object;
  };
};
event {
  name = "return"; id = 5; stream_id = 0;
  fields := struct {
    wide_type type; wide_function function;
    integer { size = 64; align = 64; base = hex; } object;
    integer { size = 64; align = 64; signed = true; } code;
  };
};
event {
  name = "message"; id = 6; stream_id = 0;
  fields := struct {
    wide_type type; wide_function function;
    integer { size = 64; align = 64; base = hex; } object;
    integer { size = 32; align = 8; } length;
    integer { size = 8; align = 8; encoding = UTF8; } text[length];
  };
};
)";

constexpr const char kHeader[] = R"(/* CTF 1.8 */
typealias integer { size = 8; align = 8; } := byte;
typealias integer { size = 32; align = 32; } := number32;
typealias integer { size = 64; align = 64; } := number64;
trace {
  major = 1; minor = 8; byte_order = le;
  uuid = "000102f0-0405-0607-0809-0a0b0c0d0eff";
  packet.header := struct {
    number32 magic; byte uuid[16]; number32 stream_id; number64 stream_instance_id;
  };
};
)";

constexpr const char kAfterClock[] =
    R"(typealias integer { size = 64; align = 64; map = clock.monotonic.value; } := time64;
stream {
  id = 0;
  packet.context := struct {
    number64 content_size; number64 packet_size; time64 timestamp_begin;
    time64 timestamp_end; number64 events_discarded; number64 tid;
  };
  event.header := struct {
    integer { size = 3; align = 64; } id;
    integer { size = 56; align = 1; map = clock.monotonic.value; } timestamp;
  };
};
)";

constexpr const char kBoot[] = "01234567-89ab-cdef-0123-456789abcdef\n";

ssize_t knownUuid(void* out, size_t bytes, unsigned int flags) {
  if (flags != 0) return -1;  // it may wait
  const unsigned char uuid[16] = {0, 1, 2, 0xF0, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 0xFF};
  memcpy(out, uuid, sizeof uuid);
  return static_cast<ssize_t>(bytes);
}

int knownHost(utsname* name) {
  memset(name, 'x', sizeof *name);
  strcpy(name->nodename, "host.1_a-\xC3\xA9\"b");
  return 0;
}

// Makes a trace below `root` at these times by both clocks, and returns what its metadata says of the clock.
class TrcMetadata : public testing::Test {
 protected:
  void SetUp() override {
    static char name[] = "a program";
    program_ = program_invocation_short_name;
    program_invocation_short_name = name;
    boot_ = temp.file("boot", kBoot);
  }
  void TearDown() override { program_invocation_short_name = program_; }

  // Makes a trace in a child process whose surroundings are all known.
  void makeTrace(
      uint64_t monotonic, int64_t realtime, const std::function<void()>& body = [] {}) {
    EXPECT_EQ(inChild([&] {
                fake::useClock(monotonic);
                fake::realtime = realtime;
                fake::files[fake::kBootId] = boot_;
                instead::getrandom = knownUuid;
                instead::uname = knownHost;
                if (traceInto(root()) != 0) return 1;
                writeFile(temp.path("pid"), std::to_string(getpid()));
                body();
                return 0;
              }),
              0);
  }

  std::string root() const { return temp.path("t"); }
  std::string pid() const { return contentsOf(temp.path("pid")); }
  std::string metadata() const { return contentsOf(files::onlyTrace(root()) / "metadata"); }

  const TempDir temp;
  std::string boot_;

 private:
  char* program_ = nullptr;
};

TEST_F(TrcMetadata, SaysWhatTheFilesHave) {
  makeTrace(5 * kSecond + 7, 1'700'000'000 * static_cast<int64_t>(kSecond) + 3);
  EXPECT_EQ(
      metadata(),
      kHeader +
          ("env { hostname = \"host.1_a-___b\"; procname = \"a_program\"; vpid = " + pid() +
           "; };\n"
           "clock {\n"
           "  name = monotonic;\n"
           "  uuid = \"01234567-89ab-cdef-0123-456789abcdef\";\n"
           "  freq = 1000000000; offset_s = 1699999994; offset = 999999996; absolute = true;\n"
           "};\n") +
          kAfterClock + enumerators("small") + kSmallEvents + enumerators("wide") + kWideEvents);
}

// The directory's name has the time in hexadecimal.
TEST_F(TrcMetadata, IsInADirectoryNamedAfterTheProgramTheProcessAndTheTime) {
  makeTrace(5 * kSecond, 0x6553F100 * static_cast<int64_t>(kSecond) + 0x1234);
  EXPECT_EQ(files::onlyTrace(root()).filename(), "a_program-" + pid() + "-6553f10000001234");
}

TEST_F(TrcMetadata, HasTheOffsetOfTheClockInSecondsAndNanoseconds) {
  struct Case {
    uint64_t monotonic;
    int64_t realtime;
    const char* seconds;
    const char* rest;
  };
  const auto second = static_cast<int64_t>(kSecond);
  for (const Case& one : {Case{kSecond, second, "0", "0"},
                          {kSecond, 2 * second, "1", "0"},
                          {kSecond, 2 * second - 1, "0", "999999999"},
                          {kSecond, second - 1, "-1", "999999999"},
                          {kSecond, 1, "-1", "1"},
                          {kSecond, 0, "-1", "0"},
                          {kSecond + 1, 0, "-2", "999999999"},
                          {3 * kSecond, second, "-2", "0"}}) {
    SCOPED_TRACE(one.realtime);
    makeTrace(one.monotonic, one.realtime);
    EXPECT_EQ(field(metadata(), "offset_s = ", ";"), one.seconds);
    EXPECT_EQ(field(metadata(), "; offset = ", ";"), one.rest);
    fs::remove_all(root());
  }
}

// Of five readings of both clocks, the first one of the shortest counts.
TEST_F(TrcMetadata, HasTheOffsetOfTheReadingThatWasNotInterrupted) {
  constexpr int kAllTheSame = -1;
  static int quick;
  for (quick = kAllTheSame; quick < 5; ++quick) {
    SCOPED_TRACE(quick);
    EXPECT_EQ(inChild([&] {
                fake::useClock(0);
                static int calls = 0;  // the first one is for the directory's name
                instead::clock_gettime = [](clockid_t clock, timespec* time) {
                  const int number = (calls + 2) / 3;  // of the reading
                  if (calls % 3 == 1) fake::monotonic = static_cast<uint64_t>(number) * kSecond;
                  if (calls % 3 == 0)
                    fake::monotonic += number == 6 ? 2 : number == quick + 1 ? 51 : 1000;
                  fake::realtime = 5000 * static_cast<int64_t>(kSecond) + 1000 * number;
                  ++calls;
                  return fake::readClock(clock, time);
                };
                return traceInto(root()) == 0 ? 0 : 1;
              }),
              0);
    const int number = std::max(quick + 1, 1);
    const int half = quick == kAllTheSame ? 500 : 25;
    const int64_t offset = (5000 - number) * static_cast<int64_t>(kSecond) + 1000 * number - half;
    EXPECT_EQ(field(metadata(), "offset_s = ", ";"),
              std::to_string(offset / static_cast<int64_t>(kSecond)));
    EXPECT_EQ(field(metadata(), "; offset = ", ";"),
              std::to_string(offset % static_cast<int64_t>(kSecond)));
    fs::remove_all(root());
  }
}

TEST_F(TrcMetadata, HasNoBootIdIfTheKernelHasNone) {
  boot_ = temp.path("missing");
  makeTrace(kSecond, 0);
  EXPECT_THAT(metadata(), HasSubstr("  name = monotonic;\n  freq = "));
  fs::remove_all(root());
  boot_ = temp.file("short", std::string(kBoot).substr(0, 35));
  makeTrace(kSecond, 0);
  EXPECT_THAT(metadata(), HasSubstr("  name = monotonic;\n  freq = "));
}

TEST_F(TrcMetadata, HasTheBootIdOfTheKernel) {
  EXPECT_EQ(inChild([&] { return traceInto(root()) == 0 ? 0 : 1; }), 0);
  std::string boot = contentsOf(fake::kBootId);
  boot.pop_back();
  EXPECT_THAT(metadata(), HasSubstr("  name = monotonic;\n  uuid = \"" + boot + "\";\n"));
}

TEST_F(TrcMetadata, HasAnEmptyHostNameIfThereIsNone) {
  EXPECT_EQ(inChild([&] {
              instead::uname = [](utsname* name) {
                memset(name, 'x', sizeof *name);
                return -1;
              };
              return traceInto(root()) == 0 ? 0 : 1;
            }),
            0);
  EXPECT_THAT(metadata(), HasSubstr("hostname = \"\";"));
}

// The name of the program in the metadata and in the directory's name.
std::vector<std::string> namesOf(const std::string& root, const std::string& program) {
  static std::string name;
  name = program;
  program_invocation_short_name = name.data();
  EXPECT_EQ(inChild([&] { return traceInto(root) == 0 ? 0 : 1; }), 0);
  const fs::path trace = files::onlyTrace(root);
  const std::string directory = trace.filename();
  const size_t time = directory.rfind('-');
  const std::string shown = directory.substr(0, directory.rfind('-', time - 1));
  std::vector<std::string> names = {shown,
                                    field(contentsOf(trace / "metadata"), "procname = \"", "\"")};
  fs::remove_all(root);
  return names;
}

TEST_F(TrcMetadata, HasASafeNameOfTheProgram) {
  const std::string safe = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-";
  for (int first = 1; first < 256; first += 51) {
    SCOPED_TRACE(first);
    std::string name;
    std::string expected;
    for (int byte = first; byte < first + 51; ++byte) {
      name += static_cast<char>(byte);
      expected +=
          safe.find(static_cast<char>(byte)) != std::string::npos ? static_cast<char>(byte) : '_';
    }
    EXPECT_THAT(namesOf(root(), name), testing::Each(expected));
  }
  EXPECT_THAT(namesOf(root(), ""), testing::Each("program"));
  EXPECT_THAT(namesOf(root(), std::string(63, 'n')), testing::Each(std::string(63, 'n')));
  EXPECT_THAT(namesOf(root(), std::string(64, 'n')), testing::Each(std::string(63, 'n')));
}

// ---- The directory ----

// The names of two traces of one process differ by the time only. Each attempt takes another time.
TEST_F(TrcMetadata, HasANameThatIsNotTakenAmongAHundred) {
  for (const int taken : {1, 99, 100}) {
    SCOPED_TRACE(taken);
    EXPECT_EQ(inChild([&] {
                fake::useClock(kSecond);
                fake::realtime = 0;
                instead::clock_gettime = [](clockid_t clock, timespec* time) {
                  if (clock == CLOCK_REALTIME) ++fake::realtime;
                  return fake::readClock(clock, time);
                };
                const std::string directory = temp.dir(std::to_string(taken));
                for (int i = 1; i <= taken; ++i) {
                  char name[64];
                  (void)snprintf(name, sizeof name, ".a_program-%d-0%08x", getpid(), i);
                  fs::create_directory(fs::path(directory) / name);
                }
                EXPECT_EQ(traceInto(directory) == 0, taken < 100);
                EXPECT_THAT(entries(directory), SizeIs(taken < 100 ? taken + 1 : taken));
                if (taken < 100) {
                  char name[64];
                  (void)snprintf(name, sizeof name, "a_program-%d-0%08x", getpid(), taken + 1);
                  EXPECT_TRUE(pathExists(directory + "/" + name)) << name;
                }
                return 0;
              }),
              0);
  }
}

}  // namespace
