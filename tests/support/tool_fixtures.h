// The files of the tests of the tool.
#pragma once

#include <stdlib.h>

#include <functional>
#include <string>

#include "tool.h"
#include "world.h"

inline const char* const kServices =
    "# services of the test\n"
    "ssh\t22/tcp\t# remote shell\n"
    "domain  53/tcp\n"
    "domain  53/udp\n"
    "ldap    389/tcp  directory\n";
inline const char* const kInittab =
    "# inittab of the test\n"
    "id:2:initdefault:\n"
    "l0:0:wait:/etc/init.d/rc 0\n"
    "vra0:2345:respawn:/opt/a:b --x\n"
    "l0:6:wait:/etc/init.d/rc 6\n";

class Tool : public ::testing::Test {
 protected:
  // Runs `osutils services COMMAND…` on the test's own file.
  Result services(
      Arguments arguments, const std::function<void()>& prepare = [] {}) const {
    arguments.insert(arguments.begin(), "services");
    arguments.insert(arguments.begin() + 2, {"--file", file});
    return osutils(std::move(arguments), prepare);
  }

  const TempDir temp;
  const std::string file = temp.file("services", kServices);
};

// An installation root for `paths` and `db`.
class Layout : public Tool {
 protected:
  Result atRoot(const Arguments& arguments) const {
    return osutils(arguments, [this] { setenv("VRA_LDAP_HOME", root.c_str(), 1); });
  }

  const std::string root = temp.dir("root");
  const std::string etc = temp.dir("root/etc");
};
