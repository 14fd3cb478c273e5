// The namespaces with which tests leave nothing on the machine.
#include <errno.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <string.h>
#include <sys/mount.h>
#include <unistd.h>

#include "world.h"

namespace {

// Runs the body in a chroot below a shared mount, with a /proc and an empty /etc.
int inChrootOfSharedMount(const std::function<int()>& body) {
  const TempDir temp;
  const std::string root = temp.path("root");
  return withPrivateMounts([&] {
    if (mount("osutils-test", temp.path().c_str(), "tmpfs", 0, nullptr) != 0 ||
        mount("none", temp.path().c_str(), nullptr, MS_SHARED, nullptr) != 0) {
      return 2;
    }
    temp.dir("root");
    temp.dir("root/etc");
    temp.dir("root/proc");
    if (mount("/proc", (root + "/proc").c_str(), nullptr, MS_BIND | MS_REC, nullptr) != 0) return 3;
    if (chroot(root.c_str()) != 0 || chdir("/etc") != 0) return 4;
    return body();
  });
}

}  // namespace

TEST(PrivateMounts, AreMadeInAChrootAndDoNotShowOutsideIt) {
  REQUIRE_ROOT("to change the root directory");

  EXPECT_EQ(inChrootOfSharedMount([] {
              EXPECT_EQ(withPrivateMounts([] {
                          EXPECT_EQ(mount("osutils-test", "/etc", "tmpfs", 0, nullptr), 0)
                              << strerror(errno);
                          writeFile("/etc/inside", "");
                          return 0;
                        }),
                        0);
              EXPECT_TRUE(pathExists("/proc/self"));
              EXPECT_FALSE(pathExists("/etc/inside"));
              return 0;
            }),
            0);
}

TEST(PrivateMounts, KeepTheChrootAndTheCurrentDirectory) {
  REQUIRE_ROOT("to change the root directory");

  EXPECT_EQ(inChrootOfSharedMount([] {
              EXPECT_EQ(withPrivateMounts([] {
                          EXPECT_FALSE(pathExists("/usr"));
                          EXPECT_FALSE(pathExists("/../usr"));
                          writeFile("made", "");
                          EXPECT_TRUE(pathExists("/etc/made"));
                          return 0;
                        }),
                        0);
              return 0;
            }),
            0);
}
