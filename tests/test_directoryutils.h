// Fixture of the tests of directories.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "files.h"
#include "osutils.h"
#include "records.h"
#include "traced_test.h"
#include "trails.h"
#include "world.h"

// ---- Expected records ----

// The queries of a directory before it is removed.
inline Trail isThere() { return joined(yes("doesFileExist"), yes("isDirectory")); }
inline Trail isFileThere() { return joined(yes("doesFileExist"), no("isDirectory")); }
inline Trail removed() { return call("deleteDirectory", 1, isThere()); }

// ---- Fixture ----

// Runs the body in a child process, so that it can change the working directory.
inline void apart(const std::function<void()>& body) {
  EXPECT_EQ(inChild([&] {
              body();
              return 0;
            }),
            0);
}

// Runs the body in a child process that is not root: permission bits do not stop root.
inline void asOrdinaryUser(const std::function<void()>& body) {
  if (geteuid() != 0) return apart(body);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     body();
                     return 0;
                   }),
            0);
}

inline void openToAll(const std::string& path) { EXPECT_EQ(chmod(path.c_str(), 0777), 0) << path; }

inline void enter(const std::string& path) { ASSERT_EQ(chdir(path.c_str()), 0) << path; }

inline std::string targetOf(const std::string& link) {
  std::error_code failure;
  const std::filesystem::path target = std::filesystem::read_symlink(link, failure);
  return failure ? "(no link)" : target.string();
}

// Returns the names in a directory.
inline std::vector<std::string> namesIn(const std::string& path) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(path)) {
    names.push_back(entry.path().filename().string());
  }
  return names;
}

// Creates and enters nested directories from `path` on, until the working directory's path has
// `length` bytes. Returns that path.
inline std::string enterDeep(std::string path, size_t length) {
  enter(path);
  while (path.size() < length) {
    const size_t left = length - path.size();
    // A step is a slash and a name, so it has at least two bytes.
    const size_t step = left <= 200 ? left : left == 201 ? 100 : 200;
    const std::string name(step - 1, 'd');
    if (mkdir(name.c_str(), 0755) != 0 || chdir(name.c_str()) != 0) {
      ADD_FAILURE() << strerror(errno);
      break;
    }
    path += "/" + name;
  }
  return path;
}
