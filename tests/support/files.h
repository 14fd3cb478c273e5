// Links, sockets, and the file mode creation mask.
#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>

class Umask {
 public:
  explicit Umask(mode_t mask) : before_(umask(mask)) {}
  ~Umask() { umask(before_); }
  Umask(const Umask&) = delete;
  Umask& operator=(const Umask&) = delete;

 private:
  mode_t before_;
};

inline void makeLink(const std::string& target, const std::string& name) {
  EXPECT_EQ(symlink(target.c_str(), name.c_str()), 0) << name;
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
