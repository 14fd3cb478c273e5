// Runs osutils-trace instead of this program.
#include "forward.h"

#include <string.h>
#include <unistd.h>

#include <filesystem>
#include <system_error>

#include "commands.h"

namespace traces {
namespace {

// Replaces this program. Returns the reason if it cannot.
std::string execReader(char** words) {
  std::error_code error;
  const std::filesystem::path self = std::filesystem::read_symlink("/proc/self/exe", error);
  if (error) return "cannot find this program: " + error.message();
  int failure = ENOENT;
  // As installed, and in the build tree.
  for (const char* const place : {OSUTILS_BIN_TO_READER, "osutils-trace"}) {
    const std::string reader = (self.parent_path() / place).lexically_normal().string();
    (void)execv(reader.c_str(), words);
    if (failure == ENOENT) failure = errno;
  }
  return std::string("cannot run the program osutils-trace: ") + strerror(failure);
}

}  // namespace

void forwardCommands(Tool& tool, char** words) {
  const auto forward = [words](Options&) -> Answer {
    throw Failure(OSUTILS_UNAVAILABLE, execReader(words));
  };
  addCommands(tool, {forward, forward, forward,
                     [forward](Options& options, bool) { return forward(options); }});
}

}  // namespace traces
