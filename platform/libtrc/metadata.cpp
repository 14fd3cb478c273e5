#include "metadata.h"

#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <sys/utsname.h>
#include <time.h>
#include <unistd.h>

#include "descriptors.h"
#include "format.h"
#include "trace_numbers.h"

namespace trc {
namespace {

struct Enumerator {
  uint64_t value;
  const char* name;
};

constexpr Enumerator kTypes[] = {
#define TRACE_TYPE(value, name) {value, name},
#include "trace_types.def"
#undef TRACE_TYPE
};

constexpr Enumerator kFunctions[] = {
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  {trace::functionId(module, ordinal), name},
#include "trace_functions.def"
#undef TRACE_FUNCTION
    {trace::kOrdinaryLevel, "ldtr_fun"},
    {trace::kErrorLevel, "ldtr_fun"},
};

constexpr int64_t kNanosecondsPerSecond = 1'000'000'000;

int64_t nanoseconds(clockid_t clock) {
  timespec time;
  (void)clock_gettime(clock, &time);
  return time.tv_sec * kNanosecondsPerSecond + time.tv_nsec;
}

// What to add to the monotonic clock to get the time since 1970: the shortest of a few readings, because one may be
// interrupted between the two clocks.
int64_t clockOffset() {
  int64_t best = 0;
  int64_t shortest = INT64_MAX;
  for (int reading = 0; reading < 5; ++reading) {
    const int64_t before = nanoseconds(CLOCK_MONOTONIC);
    const int64_t now = nanoseconds(CLOCK_REALTIME);
    const int64_t after = nanoseconds(CLOCK_MONOTONIC);
    if (after - before < shortest) {
      shortest = after - before;
      best = now - (before + (after - before) / 2);
    }
  }
  return best;
}

void replaceUnsafe(char* text) {
  constexpr const char kSafe[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-";
  for (; *text != '\0'; ++text) {
    if (strchr(kSafe, *text) == nullptr) *text = '_';
  }
}

// Appends formatted text to a buffer. After text that does not fit, length() is 0.
class TextBuffer {
 public:
  TextBuffer(char* out, size_t size) : out_(out), size_(size), length_(0) {}

  __attribute__((format(printf, 2, 3))) void add(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    const int added = vsnprintf(out_ + length_, size_ - length_, format, arguments);
    va_end(arguments);
    if (static_cast<size_t>(added) >= size_ - length_) {  // also if it is -1
      size_ = length_ = 0;
    } else {
      length_ += static_cast<size_t>(added);
    }
  }
  void addUuid(const Uuid& uuid) {
    for (size_t i = 0; i < uuid.size(); ++i) {
      add(i == 4 || i == 6 || i == 8 || i == 10 ? "-%02x" : "%02x", uuid[i]);
    }
  }
  size_t length() const { return length_; }

 private:
  char* out_;
  size_t size_;
  size_t length_;
};

// Traces of the same boot share a monotonic clock; readers compare the id.
void addBootId(TextBuffer& text) {
  const int fd = openAboveStandardStreams(AT_FDCWD, "/proc/sys/kernel/random/boot_id", O_RDONLY);
  if (fd == -1) return;
  char uuid[36];
  const ssize_t got = read(fd, uuid, sizeof uuid);
  (void)close(fd);
  if (got == sizeof uuid) {
    text.add("  uuid = \"%.*s\";\n", static_cast<int>(sizeof uuid), uuid);
  }
}

// Widths and alignment of a record's fields, in bits.
struct FieldWidths {
  unsigned type;
  unsigned function;
  unsigned object;
  unsigned object_of_return;
  unsigned object_of_message;
  unsigned code;
  unsigned align;
};
constexpr FieldWidths kSmallWidths{.type = kTypeBits,
                                   .function = kFunctionBits,
                                   .object = kObjectBits + kCodeBits,
                                   .object_of_return = kObjectBits,
                                   .object_of_message = kMessageObjectBits,
                                   .code = kCodeBits,
                                   .align = 1};
constexpr FieldWidths kWideWidths{64, 64, 64, 64, 64, 64, 64};

void addRecords(TextBuffer& text, const char* size, uint64_t layout, const FieldWidths& widths) {
  text.add("typealias enum : integer { size = %u; align = %u; base = hex; } {\n", widths.type,
           widths.align);
  const char* separator = "";
  for (const Enumerator& type : kTypes) {
    text.add("%s  \"%s\" = 0x%" PRIx64, separator, type.name, type.value);
    separator = ",\n";
  }
  text.add(
      "\n} := %s_type;\n"
      "typealias enum : integer { size = %u; align = %u; base = hex; } {\n",
      size, widths.function, widths.align);
  separator = "";
  for (const Enumerator& function : kFunctions) {
    text.add("%s  \"%s\" = 0x%" PRIx64 " ... 0x%" PRIx64, separator, function.name, function.value,
             function.value | trace::kLevelByte);
    separator = ",\n";
  }
  text.add("\n} := %s_function;\n", size);

  struct Event {
    uint64_t layout;
    const char* name;
    unsigned object;
  };
  const Event events[] = {
      {kRecord, "record", widths.object},
      {kReturn, "return", widths.object_of_return},
      {kMessage, "message", widths.object_of_message},
  };
  for (const Event& event : events) {
    text.add(
        "event {\n"
        "  name = \"%s\"; id = %" PRIu64
        "; stream_id = 0;\n"
        "  fields := struct {\n"
        "    %s_type type; %s_function function;\n"
        "    integer { size = %u; align = %u; base = hex; } object;\n",
        event.name, layout | event.layout, size, size, event.object, widths.align);
    if (event.layout == kReturn) {
      text.add("    integer { size = %u; align = %u; signed = true; } code;\n", widths.code,
               widths.align);
    } else if (event.layout == kMessage) {
      // The struct takes its alignment from these fields.
      text.add(
          "    integer { size = 32; align = 8; } length;\n"
          "    integer { size = 8; align = 8; encoding = UTF8; } text[length];\n");
    }
    text.add("  };\n};\n");
  }
}

}  // namespace

void programName(char* out, size_t size) {
  (void)snprintf(out, size, "%s", program_invocation_short_name);
  replaceUnsafe(out);
  if (out[0] == '\0') (void)snprintf(out, size, "program");
}

size_t writeMetadata(char* out, size_t size, const Uuid& trace_uuid, bool are_packets_numbered) {
  TextBuffer text(out, size);
  text.add(
      "/* CTF 1.8 */\n"
      "typealias integer { size = 8; align = 8; } := byte;\n"
      "typealias integer { size = 32; align = 32; } := number32;\n"
      "typealias integer { size = 64; align = 64; } := number64;\n"
      "trace {\n"
      "  major = 1; minor = 8; byte_order = le;\n"
      "  uuid = \"");
  text.addUuid(trace_uuid);
  text.add(
      "\";\n"
      "  packet.header := struct {\n"
      "    number32 magic; byte uuid[16]; number32 stream_id; number64 stream_instance_id;\n"
      "  };\n"
      "};\n");

  utsname host;
  if (uname(&host) != 0) host.nodename[0] = '\0';
  replaceUnsafe(host.nodename);
  char program[64];
  programName(program, sizeof program);
  text.add("env { hostname = \"%s\"; procname = \"%s\"; vpid = %d; };\n", host.nodename, program,
           static_cast<int>(getpid()));

  // The nanoseconds are not negative, even if the clock is set to a time before 1970.
  const int64_t offset = clockOffset();
  int64_t seconds = offset / kNanosecondsPerSecond;
  int64_t rest = offset % kNanosecondsPerSecond;
  if (rest < 0) {
    --seconds;
    rest += kNanosecondsPerSecond;
  }
  text.add("clock {\n  name = monotonic;\n");
  addBootId(text);
  text.add("  freq = %" PRId64 "; offset_s = %" PRId64 "; offset = %" PRId64
           "; absolute = true;\n"
           "};\n"
           "typealias integer { size = 64; align = 64; map = clock.monotonic.value; } := time64;\n"
           "stream {\n"
           "  id = 0;\n"
           "  packet.context := struct {\n"
           "    number64 content_size; number64 packet_size; time64 timestamp_begin;\n"
           "    time64 timestamp_end; number64 events_discarded; number64 tid;%s\n"
           "  };\n"
           "  event.header := struct {\n"
           "    integer { size = %u; align = %zu; } id;\n"
           "    integer { size = %u; align = 1; map = clock.monotonic.value; } timestamp;\n"
           "  };\n"
           "};\n",
           kNanosecondsPerSecond, seconds, rest,
           are_packets_numbered ? " number64 packet_seq_num;" : "", kLayoutBits,
           kRecordAlignment * 8, kTimeBits);

  addRecords(text, "small", 0, kSmallWidths);
  addRecords(text, "wide", kWide, kWideWidths);
  return text.length();
}

}  // namespace trc
