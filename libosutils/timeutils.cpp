// Time stamps and elapsed time.

#include <stdlib.h>
#include <sys/time.h>
#include <time.h>

#include <atomic>
#include <memory>

#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::FreeDeleter;
using osutils::OwnedString;
using osutils::TraceScope;

namespace {

constexpr size_t kStampBytes = 1024;
constexpr size_t kDateTimeBytes = 25;

std::atomic<long> base_time;  // in microseconds

using OwnedTime = std::unique_ptr<tm, FreeDeleter>;

long microsecondsNow() {
  timeval now = {};
  (void)gettimeofday(&now, nullptr);  // there is no result that stands for a failure
  return now.tv_sec * 1'000'000 + now.tv_usec;
}

OwnedTime newTime() { return OwnedTime(static_cast<tm*>(calloc(1, sizeof(tm)))); }

}  // namespace

TRACED char* getCurrentTimeStamp(int flag) {
  TraceScope<traced::getCurrentTimeStamp> trace;

  OwnedString stamp(static_cast<char*>(calloc(1, kStampBytes)));
  if (!stamp) {
    DEBUG_MESSAGE(trace, "timeutils:getCurrentTimeStamp ran out of memory 0.\n");
    return nullptr;
  }
  timeval now = {};
  if (gettimeofday(&now, nullptr) != 0) return nullptr;
  const int milliseconds = static_cast<int>(now.tv_usec / 1000);

  const OwnedTime local = newTime();
  if (!local) {
    DEBUG_MESSAGE(trace, "timeutils:getCurrentTimeStamp ran out of memory 2.\n");
    return nullptr;
  }
  const OwnedTime utc = newTime();
  if (!utc) {
    // sic: "2" again; there is no "1".
    DEBUG_MESSAGE(trace, "timeutils:getCurrentTimeStamp ran out of memory 2.\n");
    return nullptr;
  }
  // They fail for a year that an int cannot hold.
  if (localtime_r(&now.tv_sec, local.get()) == nullptr ||
      gmtime_r(&now.tv_sec, utc.get()) == nullptr) {
    return nullptr;
  }
  // mktime() takes the UTC fields for local standard time, so this is the zone's standard offset,
  // positive to the east.
  utc->tm_wday = -1;  // set by mktime(), unless it fails
  const auto offset = static_cast<long>(difftime(now.tv_sec, mktime(utc.get())));
  if (utc->tm_wday == -1) return nullptr;

  // sic: only the low byte counts, as if the flag were a one-byte boolean.
  if (static_cast<unsigned char>(flag) == 0) {
    (void)strftime(stamp.get(), kDateTimeBytes, "%Yy%my%dy%Hy%My%S", local.get());
    return stamp.release();
  }
  const size_t length = strftime(stamp.get(), kDateTimeBytes, "%Y-%m-%d-%H:%M:%S.", local.get());
  const int absolute_offset = abs(static_cast<int>(offset));
  // sic: the bound wraps around to nearly 4 GiB, and the minutes are the offset's seconds.
  // The buffer is far larger than the text.
  const int rc =
      vra_snprintf(stamp.get() + length, 8U - static_cast<unsigned int>(length),
                   "%03d%s%02i:%02i%s", milliseconds, offset < 0 ? "-" : "+",
                   absolute_offset / 3600, absolute_offset % 60, local->tm_isdst > 0 ? "DST" : "");
  if (rc == -1) {
    DEBUG_MESSAGE(trace, "timeutils:getCurrentTimeStamp vra_snprintf failed.\n");
    return nullptr;
  }
  return stamp.release();
}

long current_time_in_milliseconds(void) {
  static std::atomic<int> first_time = 1;
  // No lock: two first calls at the same time only set the base time twice. The flag is cleared
  // after that, so that no other thread counts from 1970.
  if (first_time != 0) {
    base_time = microsecondsNow();
    first_time = 0;
  }
  return (microsecondsNow() - base_time) / 1000;
}
