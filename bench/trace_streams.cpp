#include "trace_streams.h"

#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "format.h"

size_t recordedTraceBytes(size_t bytes_of_overwritten) {
  const char* const directory = getenv("TRC_DIR");
  if (directory == nullptr || !std::filesystem::exists(directory)) return 0;
  const bool keeps_latest = getenv("TRC_MODE") != nullptr;
  size_t bytes = 0;
  uint64_t overwritten = 0;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(directory)) {
    if (!entry.is_regular_file() || !entry.path().filename().string().starts_with("stream"))
      continue;
    trc::Packet packet;
    std::ifstream file(entry.path(), std::ios::binary);
    for (uint64_t at = 0; file.seekg(static_cast<std::streamoff>(at)) &&
                          file.read(reinterpret_cast<char*>(&packet), sizeof packet);
         at += packet.packet_size / 8) {
      if (!keeps_latest) {
        bytes += packet.content_size / 8 - sizeof packet;
      } else if (packet.tid == static_cast<uint64_t>(gettid())) {
        bytes += packet.content_size / 8 - sizeof(trc::NumberedPacket);
        overwritten = std::max(overwritten, packet.events_discarded);
      }
    }
  }
  return bytes + overwritten * bytes_of_overwritten;
}
