// Fixture of the tests of libtrc through its built shared object. What it wrote is read with
// babeltrace2, as users do.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "platform.h"
#include "world.h"

namespace fs = std::filesystem;

constexpr uint64_t kEntry = 0x3200000;
constexpr uint64_t kExit = 0x3210000;
constexpr uint64_t kDebug = 0x3400000;
constexpr uint64_t kDoesFileExist = 0x3E060100;

struct Event {
  int pid;
  unsigned long tid;
  std::string type;  // name and number as babeltrace2 shows them
  std::string function;
  std::string object;
  std::string code;  // "" when there is none
  std::string text;
};

struct Reading {
  int exit_status = -1;
  std::vector<Event> events;
  std::string errors;
};

// Returns what is between `label` and `end`.
inline std::string field(const std::string& line, const char* label, const char* end) {
  const size_t at = line.find(label);
  if (at == std::string::npos) return "";
  const size_t from = at + strlen(label);
  return line.substr(from, line.find(end, from) - from);
}

inline Event parse(const std::string& line) {
  Event event{};
  event.pid = atoi(field(line, ":(", ")").c_str());
  event.tid = strtoul(field(line, "{ tid = ", " ").c_str(), nullptr, 10);
  event.type = field(line, "type = ( ", " )");
  event.function = field(line, "function = ( ", " )");
  event.object = field(line, "object = ", line.find(", code = ") != std::string::npos ? "," : " ");
  if (event.object.ends_with(',')) event.object.pop_back();
  event.code = field(line, ", code = ", " }");
  const size_t text = line.find("text = \"");
  if (text != std::string::npos) event.text = line.substr(text + 8, line.rfind("\" }") - text - 8);
  return event;
}

// Reads the traces below a directory; `after_first` is called when the first record was read. A missing babeltrace2 is
// an error like any other.
inline Reading read(
    const std::string& directory, const std::function<void()>& after_first = [] {}) {
  const TempDir temp;
  const std::string command =
      "babeltrace2 '" + directory + "' 2>'" + temp.path("errors") + "' </dev/null";
  Reading reading;
  FILE* const output = popen(command.c_str(), "r");
  if (output == nullptr) return reading;
  char* line = nullptr;
  size_t size = 0;
  while (getline(&line, &size, output) > 0) {
    reading.events.push_back(parse(line));
    if (reading.events.size() == 1) after_first();
  }
  free(line);
  const int status = pclose(output);
  reading.exit_status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  reading.errors = contentsOf(temp.path("errors"));
  return reading;
}

// Reads a trace that must be readable without an error.
inline std::vector<Event> readEvents(const std::string& directory) {
  Reading reading = read(directory);
  EXPECT_EQ(reading.exit_status, 0) << reading.errors;
  EXPECT_EQ(reading.errors, "");
  return std::move(reading.events);
}

inline std::vector<fs::path> entries(const fs::path& directory) {
  std::vector<fs::path> found;
  for (const auto& entry : fs::directory_iterator(directory)) found.push_back(entry.path());
  std::sort(found.begin(), found.end());
  return found;
}

inline bool isHidden(const fs::path& path) { return path.filename().string().starts_with('.'); }

inline void record(uint64_t type, uint64_t id, const void* object = nullptr) {
  trcWriteRec(type, id, object, 0, nullptr, 0, 0, 0, 0);
}

// Returns how many records, or packets, are missing, according to the reader.
inline uint64_t discarded(const Reading& reading, std::string_view what = " event") {
  constexpr std::string_view kWarning = "Tracer discarded ";
  uint64_t sum = 0;
  for (size_t at = 0; (at = reading.errors.find(kWarning, at)) != std::string::npos;) {
    at += kWarning.size();
    char* end = nullptr;
    const uint64_t number = strtoull(reading.errors.c_str() + at, &end, 10);
    if (std::string_view(end).starts_with(what)) sum += number;
  }
  return sum;
}

inline void message(std::string_view text, uint64_t id = kDoesFileExist) {
  trcWriteRec(kDebug, id, nullptr, text.size(), text.data(), 0, 0, 0, 0);
}

inline void exitRecord(long code, const void* object = nullptr, uint64_t id = kDoesFileExist) {
  trcWriteRec(kExit, id, object, sizeof code, &code, 0, 0, 0, 0);
}

// Makes this (child) process trace into a directory.
inline int traceInto(const std::string& directory, const char* max_bytes = nullptr) {
  setenv("TRC_DIR", directory.c_str(), 1);
  unsetenv("TRC_EVENTS");
  if (max_bytes != nullptr) {
    setenv("TRC_MAX_BYTES", max_bytes, 1);
  } else {
    unsetenv("TRC_MAX_BYTES");
  }
  return trcInit();
}

// Runs the body in a child process that traces into a directory.
inline void inTracingChild(const std::string& directory, const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              if (traceInto(directory) != 0) return 1;
              body();
              return 0;
            }),
            0);
}

inline void traceMuch(int megabytes) {
  const std::string text(1000, 't');
  for (int i = 0; i < megabytes * 1000; ++i) message(text);
}

inline std::vector<std::string> texts(const std::vector<Event>& events) {
  std::vector<std::string> found;
  for (const Event& event : events) found.push_back(event.text);
  return found;
}
