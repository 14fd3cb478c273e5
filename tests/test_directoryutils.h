// Fixture of the tests of directories.
#pragma once

#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "calls.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

// ---- Expected records ----

inline Trail debug(const std::string& text) { return {"D " + text}; }

// A query whose stat() fails.
inline Trail query(const std::string& name, long code, int error_number) {
  return call(name, code, debug(name + ": stat() - errno=" + std::to_string(error_number) + "\n"));
}
// The queries of a directory before it is removed.
inline Trail isThere() { return joined(yes("doesFileExist"), yes("isDirectory")); }
inline Trail isFileThere() { return joined(yes("doesFileExist"), no("isDirectory")); }
inline Trail removed() { return call("deleteDirectory", 1, isThere()); }

// ---- Fixture ----

class Umask {
 public:
  explicit Umask(mode_t mask) : before_(umask(mask)) {}
  ~Umask() { umask(before_); }
  Umask(const Umask&) = delete;
  Umask& operator=(const Umask&) = delete;

 private:
  mode_t before_;
};

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

inline void makeLink(const std::string& target, const std::string& name) {
  EXPECT_EQ(symlink(target.c_str(), name.c_str()), 0) << name;
}

inline std::string targetOf(const std::string& link) {
  std::error_code failure;
  const std::filesystem::path target = std::filesystem::read_symlink(link, failure);
  return failure ? "(no link)" : target.string();
}

inline void makeSocket(const std::string& path) {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  path.copy(address.sun_path, path.size());
  const int socket_descriptor = socket(AF_UNIX, SOCK_STREAM, 0);
  EXPECT_EQ(bind(socket_descriptor, reinterpret_cast<sockaddr*>(&address), sizeof address), 0)
      << path;
  close(socket_descriptor);
}

// Returns the names in a directory.
inline std::vector<std::string> namesIn(const std::string& path) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(path)) {
    names.push_back(entry.path().filename().string());
  }
  return names;
}

// Each test runs twice: with tracing on and with tracing off.
class Directories : public testing::TestWithParam<bool> {
 protected:
  // Returns the records since the last call.
  Trail trail() {
    const Trail arrived = records_.trail();
    records_.clear();
    return arrived;
  }
  // The expected records: those of these calls, or none with tracing off.
  template <typename... Calls>
  Trail traced(const Calls&... calls) const {
    return GetParam() ? joined(calls...) : Trail();
  }

  const Umask umask_{022};
  const TempDir temp_;
  Records records_{GetParam() ? kAllEvents : uint64_t{0}};
};

#define TRACED_AND_NOT(suite)                                                        \
  class suite : public Directories {};                                               \
  INSTANTIATE_TEST_SUITE_P(Tracing, suite, testing::Bool(), [](const auto& tested) { \
    return std::string(tested.param ? "On" : "Off");                                 \
  })

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
