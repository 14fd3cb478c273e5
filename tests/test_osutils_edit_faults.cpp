// Edits of the services file and the inittab file: concurrent, killed, on full disks, with failing
// system calls.
#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <iterator>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "tool.h"
#include "tool_edits.h"
#include "world.h"

namespace {

using ::testing::AnyOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

// ---- Concurrent edits ----

// A hundred concurrent edits of two files. An edit is repeated while it fails to get the lock: on a slow
// machine the queue is longer than its timeout.
class ConcurrentEdits : public ::testing::Test {
 protected:
  static constexpr int kEach = 25;

  ConcurrentEdits() {
    for (int i = 0; i < kEach; ++i) {
      const std::string n = std::to_string(i);
      services_ += "kept" + n + "\t" + std::to_string(1000 + i) + "/tcp\n";
      services_ += "old" + n + "\t" + std::to_string(2000 + i) + "/tcp\n";
      inittab_ += "k" + n + ":2:wait:/kept\no" + n + ":2:wait:/old\n";
    }
    writeFile(services, services_);
    writeFile(inittab, inittab_);
  }

  static std::multiset<std::string> sorted(const std::string& path) {
    const std::vector<std::string> lines = linesOf(path);
    return {lines.begin(), lines.end()};
  }

  const TempDir temp;
  const std::string services = temp.path("services");
  const std::string inittab = temp.path("inittab");

 private:
  std::string services_;
  std::string inittab_;
};

TEST_F(ConcurrentEdits, AHundredEditsOfBothFilesLoseNothing) {
  std::vector<Arguments> edits;
  std::multiset<std::string> wanted_services;
  std::multiset<std::string> wanted_inittab;
  for (int i = 0; i < kEach; ++i) {
    const std::string n = std::to_string(i);
    edits.push_back(command("services", "add", services, {"new" + n, std::to_string(3000 + i)}));
    edits.push_back(command("services", "delete", services, {"old" + n}));
    edits.push_back(command("inittab", "add", inittab, {"n" + n, "2", "wait", "/new"}));
    edits.push_back(command("inittab", "delete", inittab, {"o" + n}));
    wanted_services.insert("kept" + n + "\t" + std::to_string(1000 + i) + "/tcp");
    wanted_services.insert("new" + n + "\t" + std::to_string(3000 + i) + "/tcp");
    wanted_inittab.insert({"k" + n + ":2:wait:/kept", "n" + n + ":2:wait:/new"});
  }
  std::vector<std::thread> threads;
  for (const Arguments& arguments : edits) {
    threads.emplace_back([&arguments] {
      Result result;
      do {
        result = osutils(arguments);
      } while (result.err.find("still holds the lock") != std::string::npos);
      EXPECT_EQ(result.status, 0) << result.err;
    });
  }
  for (std::thread& thread : threads) thread.join();

  EXPECT_EQ(sorted(services), wanted_services);
  EXPECT_EQ(sorted(inittab), wanted_inittab);
  EXPECT_FALSE(pathExists(services + ".vrasave") || pathExists(inittab + ".vrasave"));
}

// Some deletions are killed. An edit that finds their backup runs the command that the failure names, and
// is repeated.
TEST_F(ConcurrentEdits, NothingIsLostWhoeverDies) {
  constexpr int kVictims = 12;
  std::string more;
  for (int i = 0; i < kVictims; ++i) {
    more += "victim" + std::to_string(i) + "\t" + std::to_string(5000 + i) + "/tcp\n";
  }
  writeFile(services, contentsOf(services) + more);
  std::vector<std::thread> threads;
  for (int i = 0; i < kEach; ++i) {
    for (const bool is_addition : {true, false}) {
      threads.emplace_back([this, i, is_addition] {
        const std::string n = std::to_string(i);
        const Arguments arguments =
            is_addition
                ? command("services", "add", services, {"new" + n, std::to_string(3000 + i)})
                : command("services", "delete", services, {"old" + n});
        Result result;
        for (;;) {
          result = osutils(arguments);
          if (result.err.find("an earlier edit left a copy") != std::string::npos) {
            const Result mended = runRecommended(result);
            // Another edit has restored it, was killed, or holds the lock.
            EXPECT_THAT(mended.status, AnyOf(0, 3)) << mended.err;
          } else if (result.err.find("still holds the lock") == std::string::npos) {
            break;
          }
        }
        EXPECT_EQ(result.status, 0) << result.err;
      });
    }
  }
  for (int i = 0; i < kVictims; ++i) {
    threads.emplace_back([this, i] {
      Arguments arguments = command("services", "delete", services, {"victim" + std::to_string(i)});
      arguments.insert(arguments.begin(), OSUTILS_TOOL);
      (void)runProgram({"/usr/bin/timeout", "-s", "KILL", "0.0" + std::to_string(10 + 7 * i),
                        arguments[0], arguments[1], arguments[2], arguments[3], arguments[4],
                        arguments[5]});
    });
  }
  for (std::thread& thread : threads) thread.join();
  if (pathExists(services + ".vrasave")) {
    EXPECT_EQ(osutils(command("services", "restore", services, {"--yes"})).status, 0);
  }

  std::multiset<std::string> lines = sorted(services);
  for (int i = 0; i < kVictims; ++i) {
    const auto victim =
        lines.find("victim" + std::to_string(i) + "\t" + std::to_string(5000 + i) + "/tcp");
    if (victim != lines.end()) lines.erase(victim);
  }
  std::multiset<std::string> wanted;
  for (int i = 0; i < kEach; ++i) {
    const std::string n = std::to_string(i);
    wanted.insert("kept" + n + "\t" + std::to_string(1000 + i) + "/tcp");
    wanted.insert("new" + n + "\t" + std::to_string(3000 + i) + "/tcp");
  }
  EXPECT_EQ(lines, wanted);
}

// ---- Resource limits ----

INSTANTIATE_TEST_SUITE_P(Families, Edits, ::testing::ValuesIn(kFamilies),
                         [](const auto& each) { return std::string(each.param.name); });

TEST_P(Edits, LeaveTheFileWholeOnAFullDisk) {
  REQUIRE_ROOT("to mount a small file system");
  EXPECT_EQ(withPrivateMounts([&] {
              const std::string disk = temp.dir("disk");
              if (mount("osutils-test", disk.c_str(), "tmpfs", 0, "size=64k") != 0) return 1;
              const std::string on_disk = disk + "/file";
              std::string contents = family.contents;
              contents.resize(4096, '#');
              contents.back() = '\n';  // fills its page: one more line needs another page
              writeFile(on_disk, contents);
              EXPECT_EQ(edit(family, "add", on_disk).status,
                        0);  // makes the lock file, which stays
              writeFile(on_disk, contents);
              const int filler = open((disk + "/filler").c_str(), O_WRONLY | O_CREAT, 0600);
              const std::string block(4096, 'x');
              off_t filled = 0;
              while (write(filler, block.data(), block.size()) > 0) filled += 4096;
              for (const char* name : {"add", "delete"}) {
                SCOPED_TRACE(name);
                expectRefusal(edit(family, name, on_disk), HasSubstr(": no space left for "));
                EXPECT_EQ(contentsOf(on_disk), contents);
                EXPECT_FALSE(pathExists(on_disk + ".vrasave"));
              }
              // The rest of a block is used without free blocks.
              const std::string added = family.added;
              std::string nearly = contents.substr(0, contents.size() - added.size() - 1) + "\n";
              writeFile(on_disk, nearly);
              EXPECT_EQ(edit(family, "add", on_disk).err, "");
              nearly.insert(0, "#");
              writeFile(on_disk, nearly);
              expectRefusal(edit(family, "add", on_disk),
                            error + "add: unwilling to perform (53): no space left for " + on_disk +
                                ": 4096 bytes are needed, 0 are free\n");
              writeFile(on_disk, contents);
              // Space for the copy, but not for the new file.
              EXPECT_EQ(ftruncate(filler, filled - 4096), 0);
              expectRefusal(edit(family, "delete", on_disk),
                            error + "delete: unwilling to perform (53): no space left for " +
                                on_disk + ".vrasave: 8192 bytes are needed, 4096 are free\n");
              EXPECT_EQ(contentsOf(on_disk), contents);
              EXPECT_EQ(ftruncate(filler, filled - 2 * 4096), 0);
              EXPECT_EQ(edit(family, "delete", on_disk).err, "");
              EXPECT_EQ(edit(family, "add", on_disk).err, "");
              close(filler);
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST_P(Edits, LeaveTheFileWholeWithoutRoomOnTheDiskOfTheCopy) {
  REQUIRE_ROOT("to mount small file systems");
  EXPECT_EQ(
      withPrivateMounts([&] {
        const std::string disks[] = {temp.dir("a"), temp.dir("b")};
        for (const std::string& disk : disks) {
          if (mount("osutils-test", disk.c_str(), "tmpfs", 0, "size=16k,nr_inodes=8") != 0) {
            return 1;
          }
        }
        const std::string on_disk = disks[0] + "/file";
        const std::string copy = disks[1] + "/copy";
        writeFile(on_disk, std::string(4096, '#') + "\n" + family.contents);  // two blocks
        const auto deletion = [&] {
          return edit(family, "delete", on_disk, {"--no-lock", "--backup", copy});
        };
        const std::string refused = error + "delete: unwilling to perform (53): no space left for ";
        const std::string numbers = ": 8192 bytes are needed, 4096 are free\n";
        writeFile(disks[1] + "/filler", std::string(12288, 'x'));
        expectRefusal(deletion(), refused + copy + numbers);
        writeFile(disks[1] + "/filler", std::string(8192, 'x'));
        writeFile(disks[0] + "/filler", std::string(4096, 'x'));
        expectRefusal(deletion(), refused + on_disk + numbers);
        std::filesystem::remove(disks[0] + "/filler");
        for (int i = 0; close(creat((disks[1] + "/" + std::to_string(i)).c_str(), 0600)) == 0;) ++i;
        expectRefusal(deletion(), error + "delete: unwilling to perform (53): the file system of " +
                                      copy + " has no free inodes\n");
        std::filesystem::remove(disks[1] + "/0");
        EXPECT_EQ(deletion().err, "");
        return ::testing::Test::HasFailure() ? 1 : 0;
      }),
      0);
}

TEST_P(Edits, LeaveTheFileWholeWhereFilesMayNotGrow) {
  const size_t size = strlen(family.contents);
  const size_t added = strlen(family.added);
  for (size_t limit = 0; limit < size + added; ++limit) {
    SCOPED_TRACE(limit);
    expectRefusal(edit(family, "add", file, {}, [&] { limitFileSize(limit); }),
                  error + "add: unwilling to perform (53): this process may not write the " +
                      std::to_string(size + added) + " bytes of " + file + ": its limit is " +
                      std::to_string(limit) + "\n");
    ASSERT_EQ(contentsOf(file), family.contents);
    if (limit % 8 != 0 || limit >= size) continue;
    expectRefusal(edit(family, "delete", file, {}, [&] { limitFileSize(limit); }),
                  error + "delete: unwilling to perform (53): this process may not write the " +
                      std::to_string(size) + " bytes of " + backup + ": its limit is " +
                      std::to_string(limit) + "\n");
    ASSERT_EQ(contentsOf(file), family.contents);
    ASSERT_FALSE(pathExists(backup));
  }
  EXPECT_EQ(edit(family, "add", file, {}, [&] { limitFileSize(size + added); }).status, 0);
  EXPECT_EQ(edit(family, "delete", file, {}, [&] { limitFileSize(size + added); }).status, 0);
}

TEST_P(Edits, LeaveTheFileWholeWithoutDescriptors) {
#ifdef SANITIZER_OWNS_MALLOC
  GTEST_SKIP() << "the sanitizer ends the tool itself when it has no descriptors for its own files";
#endif
  for (const std::string name : {"add", "delete"}) {
    int done = 0;
    std::string last_failure;
    for (rlim_t most = 3; done == 0 && most < 40; ++most) {
      SCOPED_TRACE(name + " " + std::to_string(most));
      writeFile(file, family.contents);
      const Result result = edit(family, name, file, {}, [&] {
        const rlimit limit{most, most};
        setrlimit(RLIMIT_NOFILE, &limit);
      });
      EXPECT_FALSE(pathExists(backup));
      if (result.status == 0) {
        ++done;
        EXPECT_NE(contentsOf(file), family.contents);
      } else if (result.status != 127) {  // 127: the loader could not open the libraries
        expectRefusal(result, Not(""));
        EXPECT_EQ(contentsOf(file), family.contents);
        last_failure = result.err;
      }
    }
    EXPECT_EQ(done, 1);
    EXPECT_EQ(last_failure, error + name + ": unavailable (52): not enough descriptors to edit " +
                                file + ": Too many open files\n");
  }
}

TEST_P(Edits, RefuseAFolderThatTakesNoCopy) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chown(file.c_str(), kNobody, kNobody), 0);
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  EXPECT_EQ(
      asUser(kNobody,
             [&] {
               expectRefusal(edit(family, "delete", file, {"--no-lock"}, dropCoverageCounters),
                             error + "delete: insufficient access (50): cannot make a copy of " +
                                 file + " in " + temp.path() + ": Permission denied\n");
               expectRefusal(edit(family, "add", file, {}, dropCoverageCounters),
                             error + "add: insufficient access (50): cannot open the lock " + lock +
                                 ": Permission denied\n");
               EXPECT_EQ(edit(family, "add", file, {"--no-lock"}, dropCoverageCounters).status, 0);
               return ::testing::Test::HasFailure() ? 1 : 0;
             }),
      0);
}

// ---- Failing system calls ----

TEST_P(Edits, AddTakesAPartOfItsLineAway) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("short line"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line was not completely written; " + file + " is unchanged\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, AddTakesALineAwayThatCouldNotBeForcedToTheDisk) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("unforced file"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line could not be flushed to the disk: Input/output error; " + file +
                    " is unchanged\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, AddTakesALineAwayThatItCouldNotReadAgain) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("unreadable afterwards"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line could not be read again; " + file + " is unchanged\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, DeleteSaysThatTheFileIsEditedIfItCannotReadItAgain) {
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("unreadable afterwards"); }),
                error + "delete: operations error (1): " + file +
                    " is edited as requested but cannot be read again\n");
  EXPECT_EQ(contentsOf(file), family.rest);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteSaysThatTheFileMayNotBeOnTheDisk) {
  for (const bool keep : {true, false}) {
    writeFile(file, family.contents);
    const Result result = edit(family, "delete", file, {}, [] { withFault("unforced file"); });
    const std::string removal = "rm -- '" + backup + "'";
    expectRefusal(
        result, error + "delete: insufficient access (50): cannot delete \"" + family.deletion[0] +
                    "\" from " + file + "; " + file +
                    " is edited but may not be on the disk yet (to keep the edit: " + removal +
                    "); " + backup + " is a complete copy; to restore it: osutils " + family.name +
                    " restore --file '" + file + "'\n");
    EXPECT_EQ(contentsOf(file), family.rest);
    EXPECT_EQ(contentsOf(backup), family.contents);
    const Result done = keep ? runProgram({"/bin/sh", "-c", removal}) : runRecommended(result);
    EXPECT_EQ(done.status, 0);
    EXPECT_EQ(contentsOf(file), keep ? family.rest : family.contents);
    EXPECT_FALSE(pathExists(backup));
  }
}

TEST_P(Edits, RestoreKeepsTheCopyWhenTheFileCouldNotBeForcedToTheDisk) {
  writeFile(file, "# torso\n");
  writeFile(backup, family.contents);
  const Result result =
      osutils(command(family.name, "restore", file, {"--yes"}), [] { withFault("unforced file"); });
  expectRefusal(
      result,
      EndsWith("cannot flush " + file + ": Input/output error; the copy is still at " + backup +
               "; to try again: osutils " + family.name + " restore --file '" + file + "'\n"));
  EXPECT_EQ(contentsOf(backup), family.contents);
  EXPECT_EQ(runRecommended(result).status, 0);
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, AddKeepsTheLineOfAnotherProgram) {
  EXPECT_EQ(edit(family, "add", file, {}, [] { withFault("foreign line"); }).status, 0);
  EXPECT_EQ(contentsOf(file), std::string(family.contents) + "foreign 4999/tcp\n" + family.added);
}

TEST_P(Edits, DeleteRemovesACopyThatBecameTooShort) {
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("short copy"); }),
                error + "delete: insufficient access (50): cannot delete \"" + family.deletion[0] +
                    "\" from " + file + "; " + file + " is unchanged\n");
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeletePutsTheFileBackWhenItsCopyIsLost) {
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("unopenable backup"); }),
                error + "delete: insufficient access (50): cannot delete \"" + family.deletion[0] +
                    "\" from " + file + "; " + file + " is unchanged\n");
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteSaysHowToPutBackACompleteCopy) {
  const Result result = edit(family, "delete", file, {}, [] { withFault("short rewrite"); });
  expectRefusal(result, error + "delete: insufficient access (50): cannot delete \"" +
                            family.deletion[0] + "\" from " + file + "; " + file +
                            " is incomplete; " + backup +
                            " is a complete copy; to restore it: osutils " + family.name +
                            " restore --file '" + file + "'\n");
  EXPECT_EQ(contentsOf(backup), family.contents);
  EXPECT_EQ(runRecommended(result).status, 0);
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteReportsACopyThatItCouldNotRemove) {
  const Result result = edit(family, "delete", file, {}, [] { withFault("stuck backup"); });
  expectRefusal(
      result, error + "delete: operations error (1): " + file +
                  " is edited as requested; the copy at " + backup +
                  " is no longer needed but cannot be removed (Device or resource busy): rm -- '" +
                  backup + "'\n");
  EXPECT_EQ(contentsOf(file), family.rest);
  EXPECT_EQ(runRecommended(result).status, 0);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteNamesTheCopyWhereMemoryRunsOut) {
  const std::string no_memory = "osutils: no memory (90)\n";
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("no memory afterwards"); }),
                no_memory);
  EXPECT_EQ(contentsOf(file), family.rest);
  EXPECT_FALSE(pathExists(backup));

  writeFile(file, family.contents);
  const Result result =
      edit(family, "delete", file, {}, [] { withFault("no memory afterwards,stuck backup"); });
  expectRefusal(result, "osutils: " + backup + " may be a complete copy of " + file +
                            "; to restore it: osutils " + family.name + " restore --file '" + file +
                            "'\n" + no_memory);
  EXPECT_EQ(contentsOf(backup), family.contents);
}

TEST_P(Edits, AnErrorThatNobodyExpectsIsShown) {
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("other exception afterwards"); }),
                "osutils: other (80): std::bad_cast\n");
}

TEST_P(Edits, AddSaysThatItCannotSeeTheFileAnyMore) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("hidden file"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file + "; " + file +
                    " may have it but cannot be read: Input/output error\n");
}

TEST_P(Edits, AddKnowsTheLinesThatTheEditorCouldNotRead) {
  const auto unread = [] { withFault("unread lines"); };
  const auto add = [&](const Arguments& texts) {
    return osutils(command(family.name, "add", file, texts), unread);
  };
  const std::string refused = error + "add: already exists (68): " + file + " has ";
  if (family.name == std::string("inittab")) {
    for (const std::string id : {"id", "l0", "vra0"}) {
      expectRefusal(add({id, "2", "wait", "x"}), refused + "an entry \"" + id + "\"\n");
    }
  } else {
    for (const std::string name : {"ssh", "ldap"}) {
      expectRefusal(add({"--force", name, "4000"}), refused + "a service \"" + name + "\"\n");
    }
    for (const std::string port : {"22", "389"}) {
      expectRefusal(add({"--force", "new", port}), error + "add: unavailable (52): port " + port +
                                                       " is used in " + file +
                                                       " or outside 1 to 400000\n");
    }
    writeFile(file, "1 4000/tcp\n");  // not a name: the editor passes over it
    EXPECT_THAT(add({"new", "4000"}).err, HasSubstr("its line was not completely written"));
  }
}

TEST_P(Edits, AddKeepsWhatAnotherProgramWrote) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("foreign line,short line"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line was not completely written; another program changed " + file +
                    " meanwhile: check its last lines\n");
  EXPECT_EQ(contentsOf(file), std::string(family.contents) + "forei");
}

TEST_P(Edits, AddSaysHowToTakeAPartOfItsLineAway) {
  const Result result = edit(family, "add", file, {}, [] { withFault("short line,stuck size"); });
  expectRefusal(result, error + "add: operations error (1): cannot add \"new\" to " + file +
                            ": its line was not completely written; " + file +
                            " ends with a part of it (Operation not permitted); to remove that "
                            "part: truncate -s " +
                            std::to_string(strlen(family.contents)) + " -- '" + file + "'\n");
  EXPECT_EQ(runRecommended(result).status, 0);
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_F(ConcurrentEdits, AListSaysThatTheFileChanged) {
  expectRefusal(
      osutils(command("services", "list", services), [] { withFault("other first name"); }),
      "osutils: services list: operations error (1): " + services + " changed while it was read\n");
}

TEST_P(Edits, DeleteSaysThatTheLinesAreThereAgain) {
  const std::string line = family.deletion[0] + (family.deletion[0] == "l0" ? ":0:off:\n" : " 5\n");
  expectRefusal(edit(family, "delete", file, {},
                     [&] {
                       withFault("line again");
                       setenv("OSUTILS_TEST_LINE", line.c_str(), 1);
                     }),
                error + "delete: operations error (1): " + file + " still has " +
                    (family.deletion[0] == "l0" ? "an entry" : "a service") + " \"" +
                    family.deletion[0] + "\"\n");
}

TEST_P(Edits, DeleteSaysInWhichStateTheFileAndItsCopyAre) {
  const std::string failed = error + "delete: insufficient access (50): cannot delete \"" +
                             family.deletion[0] + "\" from " + file + "; " + file;
  const std::string size = std::to_string(strlen(family.contents)) + " bytes";
  const std::pair<const char*, std::string> cases[] = {
      {"short copy,stuck backup",
       " is unchanged; the copy at " + backup +
           " is no longer needed but cannot be removed (Device or resource busy): rm -- '" +
           backup + "'\n"},
      {"short rewrite,hidden copy",
       " may be damaged, and the copy at " + backup +
           ", which may be complete, cannot be read; to restore it: osutils " + family.name +
           " restore --file '" + file + "'\n"},
      {"short rewrite,lost copy",
       " is damaged (30 bytes, was " + size + "), and there is no complete copy\n"},
      {"short rewrite,lost copy,hidden file",
       " is damaged (unreadable, was " + size + "), and there is no complete copy\n"},
      {"unopenable backup,small writes", " is unchanged\n"},
  };
  for (const auto& [fault, end] : cases) {
    SCOPED_TRACE(fault);
    writeFile(file, family.contents);
    std::filesystem::remove(backup);
    const char* const name = fault;
    const std::string line = failed + end;
    expectRefusal(edit(family, "delete", file, {}, [&] { withFault(name); }), line);
  }
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, NeedNoSupportOfFlushing) {
  for (const char* fault : {"no fsync", "fsync of what cannot be written", "small writes"}) {
    SCOPED_TRACE(fault);
    const auto with_fault = [&] { withFault(fault); };
    writeFile(file, family.contents);
    EXPECT_EQ(edit(family, "add", file, {}, with_fault).err, "");
    if (fault != std::string("fsync of what cannot be written")) {  // the editor needs it
      EXPECT_EQ(edit(family, "delete", file, {}, with_fault).err, "");
    }
    writeFile(file, "# torso\n");
    writeFile(backup, family.contents);
    EXPECT_EQ(osutils(command(family.name, "restore", file, {"--yes"}), with_fault).status, 0);
    EXPECT_EQ(contentsOf(file), family.contents);
  }
}

TEST_P(Edits, RestoreKeepsTheCopyWhateverFails) {
  const std::pair<const char*, std::string> cases[] = {
      {"full disk", "cannot write all of " + file + ": No space left on device"},
      {"unforced backup", "cannot flush " + backup + ": Input/output error"},
      {"unforced folder", "cannot flush " + backup + ": Input/output error"},
  };
  writeFile(backup, family.contents);
  for (const auto& [fault, why] : cases) {
    SCOPED_TRACE(fault);
    writeFile(file, "# torso\n");
    const char* const name = fault;
    const std::string line = "osutils: " + std::string(family.name) +
                             " restore: operations error (1): " + why + "; the copy is still at " +
                             backup + "; to try again: osutils " + family.name +
                             " restore --file '" + file + "'\n";
    expectRefusal(
        osutils(command(family.name, "restore", file, {"--yes"}), [&] { withFault(name); }),
        EndsWith("\n" + line));
    EXPECT_EQ(contentsOf(backup), family.contents);
  }
}

// ---- Killed at every system call ----

// The system calls that open, change or close a file: a kill between any others has the same result.
bool isStep(uint64_t call) {
  constexpr long kSteps[] = {
#ifdef SYS_unlink
      SYS_unlink,    SYS_open,
#endif
      SYS_unlinkat,  SYS_openat,    SYS_close,           SYS_write,    SYS_pwrite64,
      SYS_writev,    SYS_ftruncate, SYS_copy_file_range, SYS_sendfile, SYS_fsync,
      SYS_fdatasync, SYS_fcntl,     SYS_fchmod,          SYS_fchown};
  return std::find(std::begin(kSteps), std::end(kSteps), static_cast<long>(call)) !=
         std::end(kSteps);
}

// Runs the tool and kills it before its step `number`, counted from the opening of the lock. Returns false
// if the tool ended before that, nothing if it cannot be traced.
std::optional<bool> killedAt(Arguments arguments, const std::string& lock, int number) {
  arguments.insert(arguments.begin(), OSUTILS_TOOL);
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  const pid_t child = fork();
  if (child == 0) {
    const int null = open("/dev/null", O_RDWR);
    dup2(null, STDOUT_FILENO);
    dup2(null, STDERR_FILENO);
    setenv("ASAN_OPTIONS", "detect_leaks=0:detect_odr_violation=0",
           1);  // LeakSanitizer uses ptrace itself
    dropCoverageCounters();
    if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) _exit(125);
    raise(SIGSTOP);
    execv(argv[0], argv.data());
    _exit(126);
  }
  int status = 0;
  if (waitpid(child, &status, 0) != child || !WIFSTOPPED(status)) return std::nullopt;
  if (ptrace(PTRACE_SETOPTIONS, child, nullptr, PTRACE_O_TRACESYSGOOD | PTRACE_O_EXITKILL) != 0) {
    return std::nullopt;
  }
  int steps = -1;  // before the lock
  long signal = 0;
  for (;;) {
    if (ptrace(PTRACE_SYSCALL, child, nullptr, signal) != 0) return std::nullopt;
    if (waitpid(child, &status, 0) != child) return std::nullopt;
    if (!WIFSTOPPED(status)) return false;
    signal = WSTOPSIG(status);
    if (signal != (SIGTRAP | 0x80)) {
      if (signal == SIGTRAP) signal = 0;  // caused by execv
      continue;
    }
    signal = 0;
    __ptrace_syscall_info info = {};
    if (ptrace(PTRACE_GET_SYSCALL_INFO, child, sizeof info, &info) <= 0) return std::nullopt;
    if (info.op != PTRACE_SYSCALL_INFO_ENTRY || !isStep(info.entry.nr)) continue;
    if (steps == -1) {
      if (info.entry.nr != SYS_openat) continue;
      std::string path;
      for (uint64_t at = info.entry.args[1]; path.size() < lock.size();) {
        errno = 0;
        const long word = ptrace(PTRACE_PEEKDATA, child, at + path.size(), nullptr);
        if (errno != 0) break;
        path.append(reinterpret_cast<const char*>(&word), sizeof word);
      }
      if (!path.starts_with(lock)) continue;
      steps = 0;
    }
    if (++steps == number) {
      kill(child, SIGKILL);
      waitpid(child, &status, 0);
      return true;
    }
  }
}

// Kills the tool before each of its steps in turn until it ends by itself. Calls `check` after each kill.
void killAtEveryStep(const Arguments& arguments, const std::string& lock,
                     const std::function<void()>& prepare, const std::function<void()>& check) {
  int killed = 0;
  for (int number = 1;; ++number) {
    SCOPED_TRACE("step " + std::to_string(number));
    prepare();
    const std::optional<bool> result = killedAt(arguments, lock, number);
    if (!result) GTEST_SKIP() << "processes cannot be traced here";
    check();
    if (::testing::Test::HasFailure() || !*result) break;
    ++killed;
  }
  EXPECT_GE(killed, 5);  // fewer would prove nothing
}

TEST_P(Edits, AKilledDeletionLosesNothing) {
  const std::string whole = family.contents;
  killAtEveryStep(
      command(family.name, "delete", file, family.deletion), lock, [&] { writeFile(file, whole); },
      [&] {
        const std::string left = contentsOf(file);
        EXPECT_TRUE(left == whole || left == family.rest ||
                    (pathExists(backup) && contentsOf(backup) == whole))
            << left;
        const Result next = edit(family, "add", file);
        if (next.status == 0) {
          EXPECT_FALSE(pathExists(backup));
          EXPECT_TRUE(left == whole || left == family.rest) << left;
          EXPECT_EQ(contentsOf(file), left + family.added);
          return;
        }
        expectRefusal(next, HasSubstr("an earlier edit left a copy at " + backup));
        EXPECT_EQ(contentsOf(file), left);
        EXPECT_EQ(runRecommended(next).status, 0);
        EXPECT_EQ(contentsOf(file), whole);
        EXPECT_EQ(edit(family, "delete", file).status, 0);
        EXPECT_EQ(contentsOf(file), family.rest);
      });
}

TEST_P(Edits, AKilledAdditionLeavesTheFileWithTheLineOrWithoutIt) {
  const std::string whole = family.contents;
  killAtEveryStep(
      command(family.name, "add", file, family.addition), lock, [&] { writeFile(file, whole); },
      [&] {
        EXPECT_THAT(contentsOf(file), AnyOf(whole, whole + family.added));
        EXPECT_FALSE(pathExists(backup));
      });
}

TEST_P(Edits, AKilledRestorationLeavesTheCopyOrTheFileWhole) {
  const std::string whole = family.contents;
  killAtEveryStep(
      command(family.name, "restore", file, {"--yes"}), lock,
      [&] {
        writeFile(file, whole.substr(0, 10) + "#");
        writeFile(backup, whole);
      },
      [&] {
        if (pathExists(backup)) {
          EXPECT_EQ(contentsOf(backup), whole);
          EXPECT_EQ(osutils(command(family.name, "restore", file, {"--yes"})).status, 0);
        }
        EXPECT_EQ(contentsOf(file), whole);
        EXPECT_FALSE(pathExists(backup));
      });
}

}  // namespace
