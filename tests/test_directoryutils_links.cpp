#include <errno.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "faults.h"
#include "osutils.h"
#include "test_directoryutils.h"
#include "trails.h"
#include "world.h"

using testing::UnorderedElementsAre;

namespace {

TRACED_AND_NOT(CreateSymLink);
TRACED_AND_NOT(RemoveSymLink);

// ---- createSymLink ----

TEST_P(CreateSymLink, RefusesANullArgument) {
  const std::string link = temp_.path("link");
  const Trail refused = call("createSymLink", 89, debug("createSymLink: passed a null pointer.\n"));
  const FailingCall made(Call::symlink, 0, kNever);

  EXPECT_EQ(createSymLink(nullptr, link.c_str()), 89);
  EXPECT_EQ(trail(), traced(refused));
  EXPECT_EQ(createSymLink("target", nullptr), 89);
  EXPECT_EQ(trail(), traced(refused));
  EXPECT_EQ(createSymLink(nullptr, nullptr), 89);
  EXPECT_EQ(trail(), traced(refused));

  EXPECT_EQ(made.calls(), 0);
  EXPECT_FALSE(pathExists(link));
}

TEST_P(CreateSymLink, LeadsToTheTargetAsItIsWritten) {
  const std::string file = temp_.file("file", "text");
  int number = 0;
  for (const std::string& target : {file, std::string("file"), std::string("../x y"),
                                    std::string("no/where"), std::string("/")}) {
    SCOPED_TRACE(target);
    const std::string link = temp_.path("link" + std::to_string(number++));
    EXPECT_EQ(createSymLink(target.c_str(), link.c_str()), 0);
    EXPECT_EQ(trail(), traced(no("createSymLink")));
    EXPECT_EQ(targetOf(link), target);
  }
  EXPECT_EQ(contentsOf(temp_.path("link0")), "text");
  EXPECT_EQ(contentsOf(temp_.path("link1")), "text");
}

TEST_P(CreateSymLink, ShowsTheErrorNumberUnderAnotherName) {
  const std::string file = temp_.file("file", "text");
  const std::string directory = temp_.dir("directory");
  makeLink("nowhere", temp_.path("dangling"));
  const auto refused = [](int error_number) {
    return call(
        "createSymLink", -1,
        debug("createDirectory: symlink() failed with rc='" + std::to_string(error_number) + "'"));
  };

  EXPECT_EQ(createSymLink("target", file.c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", directory.c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", temp_.path("dangling").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(EEXIST)));
  EXPECT_EQ(createSymLink("target", temp_.path("missing/link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("", temp_.path("link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("target", ""), -1);
  EXPECT_EQ(trail(), traced(refused(ENOENT)));
  EXPECT_EQ(createSymLink("target", (file + "/link").c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENOTDIR)));
  EXPECT_EQ(createSymLink("target", temp_.path(std::string(300, 'n')).c_str()), -1);
  EXPECT_EQ(trail(), traced(refused(ENAMETOOLONG)));

  EXPECT_THAT(namesIn(temp_.path()), UnorderedElementsAre("file", "directory", "dangling"));
  EXPECT_EQ(contentsOf(file), "text");
  EXPECT_EQ(targetOf(temp_.path("dangling")), "nowhere");
}

TEST_P(CreateSymLink, WherePermissionsForbidItFails) {
  const std::string closed = temp_.dir("closed");
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  asOrdinaryUser([&] {
    EXPECT_EQ(createSymLink("target", (closed + "/link").c_str()), -1);
    EXPECT_EQ(trail(), traced(call("createSymLink", -1,
                                   debug("createDirectory: symlink() failed with rc='13'"))));
  });
}

TEST_P(CreateSymLink, ReportsAFailedSystemCall) {
  const FailingCall made(Call::symlink, EIO);
  EXPECT_EQ(createSymLink("target", temp_.path("link").c_str()), -1);
  ASSERT_TRUE(made.fired());
  EXPECT_EQ(trail(), traced(call("createSymLink", -1,
                                 debug("createDirectory: symlink() failed with rc='5'"))));
}

// ---- removeSymLink ----

Trail notRemoved(int error_number) {
  return call(
      "removeSymLink", -1,
      debug("removeSymLink: unlink() failed with rc='" + std::to_string(error_number) + "'"));
}

TEST_P(RemoveSymLink, RefusesANullPath) {
  EXPECT_EQ(removeSymLink(nullptr), 89);
  EXPECT_EQ(trail(),
            traced(call("removeSymLink", 89, debug("removeSymLink: passed a null pointer.\n"))));
}

TEST_P(RemoveSymLink, RemovesTheLinkAndNotWhatItLeadsTo) {
  const std::string directory = temp_.dir("directory");
  const std::string file = temp_.file("directory/file", "text");
  const std::string links[] = {temp_.path("to directory"), temp_.path("to file"),
                               temp_.path("dangling")};
  makeLink(directory, links[0]);
  makeLink(file, links[1]);
  makeLink("nowhere", links[2]);

  for (const std::string& link : links) {
    SCOPED_TRACE(link);
    EXPECT_EQ(removeSymLink(link.c_str()), 0);
    EXPECT_EQ(trail(), traced(no("removeSymLink")));
    EXPECT_FALSE(pathExists(link));
  }
  EXPECT_EQ(contentsOf(file), "text");
}

TEST_P(RemoveSymLink, RemovesAFileToo) {
  const std::string file = temp_.file("file", "text");
  EXPECT_EQ(removeSymLink(file.c_str()), 0);
  EXPECT_EQ(trail(), traced(no("removeSymLink")));
  EXPECT_FALSE(pathExists(file));
}

TEST_P(RemoveSymLink, OfADirectoryOrNothingFails) {
  const std::string directory = temp_.dir("directory");

  EXPECT_EQ(removeSymLink(directory.c_str()), -1);
  EXPECT_EQ(trail(), traced(notRemoved(EISDIR)));
  EXPECT_EQ(removeSymLink(temp_.path("missing").c_str()), -1);
  EXPECT_EQ(trail(), traced(notRemoved(ENOENT)));
  EXPECT_EQ(removeSymLink(""), -1);
  EXPECT_EQ(trail(), traced(notRemoved(ENOENT)));

  EXPECT_TRUE(std::filesystem::is_directory(directory));
}

TEST_P(RemoveSymLink, WherePermissionsForbidItFails) {
  const std::string closed = temp_.dir("closed");
  const std::string link = temp_.path("closed/link");
  makeLink("target", link);
  ASSERT_EQ(chmod(closed.c_str(), 0555), 0);
  asOrdinaryUser([&] {
    EXPECT_EQ(removeSymLink(link.c_str()), -1);
    EXPECT_EQ(trail(), traced(notRemoved(EACCES)));
  });
  ASSERT_EQ(chmod(closed.c_str(), 0755), 0);
  EXPECT_EQ(targetOf(link), "target");
}

TEST_P(RemoveSymLink, ReportsAFailedSystemCall) {
  const std::string link = temp_.path("link");
  makeLink("target", link);
  const FailingCall taken_away(Call::unlink, EBUSY);

  EXPECT_EQ(removeSymLink(link.c_str()), -1);

  ASSERT_TRUE(taken_away.fired());
  EXPECT_EQ(trail(), traced(notRemoved(EBUSY)));
  EXPECT_EQ(targetOf(link), "target");
}

}  // namespace
