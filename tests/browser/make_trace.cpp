// make_trace story: writes a trace with calls that fail, that do not end, and that have hostile texts.
// make_trace CALLS [THREADS]: writes so many short calls, of which every hundredth fails.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <string_view>
#include <thread>
#include <vector>

#include "platform.h"
#include "trace_numbers.h"
#include "trace_scope.h"

namespace {

namespace traced = osutils::traced;

constexpr int64_t kNoSuchObject = 32;

void enter(osutils::TracedFunction function) {
  trcWriteRec(function.trace_class == 43 ? trace::kEntry43 : trace::kEntry33, function.id, nullptr,
              0, nullptr, 0, 0, 0, 0);
}

void leave(osutils::TracedFunction function, int64_t code) {
  const bool is_43 = function.trace_class == 43;
  const uint64_t type = code == 0 ? (is_43 ? trace::kExit43 : trace::kExit33)
                                  : (is_43 ? trace::kErrorExit43 : trace::kErrorExit33);
  trcWriteRec(type, function.id, nullptr, sizeof code, &code, 0, 0, 0, 0);
}

void say(osutils::TracedFunction function, std::string_view text, bool is_error = false) {
  trcWriteRec(is_error ? trace::kDebugError : trace::kDebug, function.id, nullptr, text.size(),
              text.data(), 0, 0, 0, 0);
}

void pause(long milliseconds) {
  const timespec time{0, milliseconds * 1'000'000};
  (void)nanosleep(&time, nullptr);
}

void call(osutils::TracedFunction function, int64_t code, long milliseconds) {
  enter(function);
  pause(milliseconds);
  leave(function, code);
}

void tellStory() {
  enter(traced::EtcServices_readEtcServices);
  enter(traced::checkFilePerms);
  call(traced::doesFileExist, 1, 4);
  call(traced::isDirectory, 0, 4);
  leave(traced::checkFilePerms, 0);
  enter(traced::checkFilePerms);
  say(traced::checkFilePerms,
      "</script><script>document.title = \"run\"</script><img src=x onerror=alert(1)>\n", true);
  say(traced::checkFilePerms, "control \x1b[31m\x07 and invalid \xff\xfe, \xe2\x80\xae reversed\n");
  pause(12);
  leave(traced::checkFilePerms, kNoSuchObject);
  leave(traced::EtcServices_readEtcServices, kNoSuchObject);
  call(traced::isMemberOfGroup, 1, 4);  // yes, and no failure
  call(traced::copyFile, 0, 4);         // false: a failure
  std::thread([] {
    call(traced::getEnvVar, 0, 4);
    enter(traced::copyFile);
    say(traced::copyFile, "copying\n");
  }).join();
  call(traced::getEnvVar, 0, 4);
}

void makeCalls(uint64_t count) {
  const int64_t no = 0;
  while (count > 0) {
    enter(traced::EtcServices_readEtcServices);
    for (int i = 0; i < 4 && count > 1; ++i, --count) {
      enter(traced::checkFilePerms);
      if (count % 10 == 0) say(traced::checkFilePerms, "checkFilePerms: looked at /etc/services\n");
      leave(traced::checkFilePerms, count % 100 == 0 ? kNoSuchObject : no);
    }
    leave(traced::EtcServices_readEtcServices, 0);
    --count;
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && strcmp(argv[1], "story") == 0) {
    tellStory();
    return 0;
  }
  const uint64_t calls = argc > 1 ? strtoull(argv[1], nullptr, 10) : 0;
  const uint64_t threads = argc > 2 ? strtoull(argv[2], nullptr, 10) : 1;
  if (calls == 0 || threads == 0) {
    (void)fputs("usage: make_trace story | CALLS [THREADS]\n", stderr);
    return 2;
  }
  std::vector<std::thread> running;
  for (uint64_t i = 0; i < threads; ++i) running.emplace_back(makeCalls, calls / threads);
  for (std::thread& thread : running) thread.join();
  return 0;
}
