// The commands that edit the services file and the inittab file: side by side, killed, on full disks.
#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <net/if.h>
#include <netinet/in.h>
#include <signal.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <iterator>
#include <optional>
#include <ostream>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "system_call_filter.h"
#include "tool.h"
#include "tool_edits.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::AnyOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

INSTANTIATE_TEST_SUITE_P(Families, Edits, ::testing::ValuesIn(kFamilies),
                         [](const auto& each) { return std::string(each.param.name); });

// ---- Side by side ----

// What a hundred edits at a time do to one pair of files; each is tried again for as long as it says that
// somebody holds the lock, which on a slow machine takes longer than it waits.
class SideBySide : public ::testing::Test {
 protected:
  static constexpr int kEach = 25;

  SideBySide() {
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

TEST_F(SideBySide, AHundredEditsOfBothFilesLoseNothing) {
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

// Deletions are killed at any time. Who finds what they left follows the hint and tries again.
TEST_F(SideBySide, NothingIsLostWhoeverDies) {
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
            const Result mended = follow(result);
            // Another one was faster, or somebody died again, or holds the lock.
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

// ---- The lock ----

TEST_P(Edits, TheLockHoldsTheProcessAndItsCommandAndStays) {
  for (const char* name : {"add", "delete"}) {
    EXPECT_EQ(edit(family, name, file, {"--json"}).status, 0);
    EXPECT_EQ(modeOf(lock), 0600U);
    const std::string text = contentsOf(lock);
    EXPECT_GT(atoi(text.c_str()), 0);
    EXPECT_THAT(text, AllOf(HasSubstr(std::string(" ") + OSUTILS_TOOL + " " + family.name + " " +
                                      name + " --file " + file),
                            EndsWith("\n")));
  }
}

TEST_P(Edits, WaitForTheLockAndNameItsHolder) {
  for (const char* name : {"add", "delete"}) {
    SCOPED_TRACE(name);
    Holder holder(lock);
    int err[2];
    ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
    Result result;
    std::thread waiting(
        [&] { result = edit(family, name, file, {}, [&] { dup2(err[1], STDERR_FILENO); }); });
    std::string line;
    for (char c = 0; c != '\n' && read(err[0], &c, 1) == 1;) line += c;
    EXPECT_EQ(line, "osutils: waiting up to 15 s for " + lock + ": process " +
                        std::to_string(holder.process()) + " (backup ? of files) holds it\n");
    EXPECT_EQ(contentsOf(file), family.contents);
    holder.release();
    waiting.join();
    close(err[0]);
    close(err[1]);
    EXPECT_EQ(result.status, 0);
    writeFile(file, family.contents);
  }
}

TEST_P(Edits, FailWhenTheLockIsNotReleased) {
  const Holder holder(lock);
  const auto start = std::chrono::steady_clock::now();
  const Result result = edit(family, "delete", file);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(15));
  expectRefusal(result, EndsWith(error + "delete: unavailable (52): process " +
                                 std::to_string(holder.process()) +
                                 " (backup ? of files) still holds the lock " + lock + "\n"));
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, DoWithoutTheLockWhenTheyAreTold) {
  const Holder holder(lock);
  EXPECT_EQ(edit(family, "add", file, {"--no-lock"}).status, 0);
  EXPECT_EQ(edit(family, "delete", file, {"--no-lock"}).status, 0);
  writeFile(backup, family.contents);
  EXPECT_EQ(osutils(command(family.name, "restore", file, {"--no-lock", "--yes"})).status, 0);
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_THAT(contentsOf(lock), HasSubstr("backup"));
}

TEST_P(Edits, LockTheFileUnderEachOfItsNames) {
  const std::string link = temp.path("link");
  ASSERT_EQ(symlink(file.c_str(), link.c_str()), 0);
  const Holder holder(lock);
  int err[2];
  ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
  const pid_t child = fork();
  if (child == 0) {
    dup2(err[1], STDERR_FILENO);
    const std::vector<std::string> words = command(family.name, "delete", link, family.deletion);
    execl(OSUTILS_TOOL, OSUTILS_TOOL, words[0].c_str(), words[1].c_str(), words[2].c_str(),
          words[3].c_str(), words[4].c_str(), nullptr);
    _exit(126);
  }
  char first = 0;
  EXPECT_EQ(read(err[0], &first, 1), 1);
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  close(err[0]);
  close(err[1]);
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(link + ".lock"));
}

TEST_P(Edits, RefuseALockThatIsNoFileOfItsOwn) {
  const std::string other = temp.file("other", "other");
  const std::string refused = "unwilling to perform (53): the lock " + lock;
  const auto expectRefused = [&](const std::string& why) {
    SCOPED_TRACE(why);
    expectRefusal(edit(family, "add", file), error + "add: " + refused + why + "\n");
    expectRefusal(edit(family, "delete", file), error + "delete: " + refused + why + "\n");
    EXPECT_EQ(contentsOf(file), family.contents);
    EXPECT_EQ(contentsOf(other), "other");
    std::filesystem::remove(lock);
  };
  ASSERT_EQ(symlink(other.c_str(), lock.c_str()), 0);
  expectRefused(" is a symbolic link");
  ASSERT_EQ(symlink(temp.path("missing").c_str(), lock.c_str()), 0);
  expectRefused(" is a symbolic link");
  EXPECT_FALSE(pathExists(temp.path("missing")));
  ASSERT_EQ(link(other.c_str(), lock.c_str()), 0);
  expectRefused(" has several names");
  ASSERT_EQ(mkfifo(lock.c_str(), 0600), 0);
  expectRefused(" is not a regular file");
}

TEST_P(Edits, TheLockOfAnothersFileIsTheirs) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chown(temp.path().c_str(), kNobody, kNobody), 0);
  ASSERT_EQ(chown(file.c_str(), kNobody, kNobody), 0);
  EXPECT_EQ(edit(family, "add", file).status, 0);
  EXPECT_EQ(asUser(kNobody,
                   [&] { return edit(family, "delete", file, {}, dropCoverageCounters).status; }),
            0);
}

TEST_P(Edits, RefuseTheLockAsTheBackup) {
  for (const char* name : {"add", "delete"}) {
    expectRefusal(edit(family, name, file, {"--backup", lock, "--discard-backup"}),
                  HasSubstr("the backup path " + lock + " is the lock"));
  }
  expectRefusal(osutils(command(family.name, "restore", file, {"--backup", lock, "--yes"})),
                HasSubstr("the backup path " + lock + " is the lock"));
  EXPECT_EQ(contentsOf(file), family.contents);
}

// ---- Copies of earlier edits ----

TEST_P(Edits, StopAtACopyAndSayHowToPutItBack) {
  const std::string whole = std::string(family.contents) + "\n# more\n";
  for (const char* name : {"add", "delete"}) {
    SCOPED_TRACE(name);
    writeFile(file, "# torso\n");
    writeFile(backup, whole);
    const Result result = edit(family, "add", file);
    expectRefusal(result, error +
                              "add: unwilling to perform (53): an earlier edit left a copy at " +
                              backup + ", and " + file +
                              " may have lost lines since; to see the difference and put the copy "
                              "back: osutils " +
                              family.name + " restore --file '" + file + "'\n");
    expectRefusal(edit(family, "delete", file), HasSubstr("an earlier edit left a copy"));
    EXPECT_EQ(contentsOf(file), "# torso\n");
    EXPECT_EQ(follow(result).status, 0);
    EXPECT_EQ(contentsOf(file), whole);
    EXPECT_FALSE(pathExists(backup));
    EXPECT_EQ(edit(family, name, file).status, 0);
  }
}

TEST_P(Edits, SayThatACopyIsOfNoUse) {
  const std::string whole = family.contents;
  for (const std::string& copy : {whole, whole.substr(0, whole.size() / 2), std::string()}) {
    SCOPED_TRACE(copy);
    writeFile(backup, copy);
    const Result result = edit(family, "delete", file);
    expectRefusal(result, error +
                              "delete: unwilling to perform (53): an earlier edit left a copy at " +
                              backup + ", all of which is in " + file + "; to remove it: osutils " +
                              family.name + " restore --file '" + file + "'\n");
    const Result removal = follow(result);
    EXPECT_EQ(removal.status, 0);
    EXPECT_EQ(removal.out, "REMOVED\n" + backup + "\n");
    EXPECT_EQ(contentsOf(file), whole);
    EXPECT_FALSE(pathExists(backup));
  }
  writeFile(backup, whole.substr(0, 10));
  EXPECT_EQ(osutils(command(family.name, "restore", file, {"--force", "--yes"})).status, 0);
  EXPECT_EQ(contentsOf(file), whole.substr(0, 10));
}

TEST_P(Edits, RefuseWhatIsNoCopyAtTheBackupPath) {
  const std::string other = temp.file("other", "other");
  const auto expectRefused = [&](const std::string& why) {
    SCOPED_TRACE(why);
    for (const char* name : {"add", "delete"}) {
      for (const Arguments& options : {Arguments{}, Arguments{"--discard-backup"}}) {
        expectRefusal(
            edit(family, name, file, options),
            error + name + ": unwilling to perform (53): the backup path " + backup + why + "\n");
      }
    }
    expectRefusal(osutils(command(family.name, "restore", file, {"--yes"})), Not(""));
    EXPECT_EQ(contentsOf(file), family.contents);
    EXPECT_EQ(contentsOf(other), "other");
    EXPECT_TRUE(pathExists(backup));
    std::filesystem::remove(backup);
  };
  ASSERT_EQ(symlink(other.c_str(), backup.c_str()), 0);
  expectRefused(" is taken by a symbolic link");
  ASSERT_EQ(symlink("nowhere", backup.c_str()), 0);
  expectRefused(" is taken by a symbolic link");
  ASSERT_EQ(symlink(file.c_str(), backup.c_str()), 0);
  expectRefused(" leads to the file itself");
  ASSERT_EQ(link(file.c_str(), backup.c_str()), 0);
  expectRefused(" leads to the file itself");
  ASSERT_EQ(mkfifo(backup.c_str(), 0600), 0);
  expectRefused(" is taken by a FIFO");
  ASSERT_EQ(mkdir(backup.c_str(), 0700), 0);
  expectRefused(" is taken by a directory");
  if (mknod(backup.c_str(), S_IFCHR | 0600, makedev(1, 3)) == 0)
    expectRefused(" is taken by a device");
}

TEST_P(Edits, RefuseAnEmptyBackupPath) {
  for (const char* name : {"add", "delete"}) {
    expectFailure(edit(family, name, file, {"--backup", ""}),
                  error + name + ": parameter error (89): --backup is empty\n");
  }
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, DiscardACopyWhenTheyAreTold) {
  for (const char* name : {"add", "delete"}) {
    writeFile(file, family.contents);
    writeFile(backup, "# another\n");
    EXPECT_EQ(edit(family, name, file, {"--discard-backup"}).status, 0);
    EXPECT_FALSE(pathExists(backup));
  }
  EXPECT_EQ(contentsOf(file), family.rest);
}

TEST_P(Edits, DiscardNoCopyWhenTheyStopForAnotherReason) {
  writeFile(backup, "# another\n");
  const rlim_t size = strlen(family.contents) - 1;
  for (const char* name : {"add", "delete"}) {
    expectRefusal(edit(family, name, file, {"--discard-backup"}, [&] { limitFileSize(size); }),
                  HasSubstr("its limit is " + std::to_string(size)));
    EXPECT_EQ(contentsOf(backup), "# another\n");
  }
  EXPECT_EQ(edit(family, "add", file, {"--discard-backup", "--dry-run"}).status, 0);
  EXPECT_EQ(contentsOf(backup), "# another\n");
}

TEST_P(Edits, DiscardNoCopyOfAnothersAndNoneThatTheyCannotRead) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chown(temp.path().c_str(), kNobody, kNobody), 0);
  ASSERT_EQ(chown(file.c_str(), kNobody, kNobody), 0);
  writeFile(backup, "# another\n");
  const auto as_nobody = [&](const char* name, const Arguments& options, const std::string& why) {
    EXPECT_EQ(asUser(kNobody,
                     [&] {
                       expectRefusal(edit(family, name, file, options, dropCoverageCounters),
                                     HasSubstr(why));
                       return ::testing::Test::HasFailure() ? 1 : 0;
                     }),
              0);
  };
  for (const char* name : {"add", "delete"}) {
    ASSERT_EQ(chown(backup.c_str(), 0, 0), 0);
    ASSERT_EQ(chmod(backup.c_str(), 0644), 0);
    as_nobody(name, {"--discard-backup"}, backup + " belongs to another user");
    // This one cost an ordinary user the whole file.
    ASSERT_EQ(chown(backup.c_str(), kNobody, kNobody), 0);
    ASSERT_EQ(chmod(backup.c_str(), 0200), 0);
    as_nobody(name, {"--discard-backup"}, "cannot read " + backup + ": Permission denied");
    as_nobody(name, {},
              ", which cannot be read: Permission denied; to make it readable: chmod u+r -- '" +
                  backup + "'\n");
  }
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_EQ(contentsOf(backup), "# another\n");
}

// ---- Putting a copy back ----

// A chroot has no file system of terminals unless somebody mounts one.
bool hasTerminals() {
  const int terminal = posix_openpt(O_RDWR | O_NOCTTY);
  if (terminal != -1) close(terminal);
  return terminal != -1;
}

// Answers the tool's question on a terminal of its own, which `multiplexer` makes.
Result onTerminal(const std::string& multiplexer, const Arguments& arguments,
                  const std::string& answer) {
  const int terminal = open(multiplexer.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC);
  if (terminal == -1 || unlockpt(terminal) != 0) return {};
  (void)!write(terminal, answer.data(), answer.size());
  const Result result = osutils(
      arguments, [&] { dup2(ioctl(terminal, TIOCGPTPEER, O_RDWR | O_NOCTTY), STDIN_FILENO); });
  close(terminal);
  return result;
}

class Restoration : public Edits {
 protected:
  void prepare() const {
    writeFile(file, "# torso\n");
    writeFile(backup, "# torso\nrest\t1\n");
  }
  void expectQuestions(const std::string& multiplexer) const;

  const Arguments arguments = command(family.name, "restore", file);
  const std::string difference =
      "--- " + file + "\n+++ " + backup + "\n@@ -1 +1,2 @@\n # torso\n+rest\t1\n";
};
INSTANTIATE_TEST_SUITE_P(Families, Restoration, ::testing::ValuesIn(kFamilies),
                         [](const auto& tested) { return std::string(tested.param.name); });

void Restoration::expectQuestions(const std::string& multiplexer) const {
  const std::string question = "Put " + backup + " back into " + file + "? [y/N] ";
  prepare();
  for (const char* no : {"n\n", "\n", "yes, but\n", "\004"}) {
    SCOPED_TRACE(no);
    expectRefusal(onTerminal(multiplexer, arguments, no),
                  difference + question + error +
                      "restore: unwilling to perform (53): nothing was changed\n");
    EXPECT_EQ(contentsOf(file), "# torso\n");
    EXPECT_EQ(contentsOf(backup), "# torso\nrest\t1\n");
  }
  for (const char* yes : {"y\n", "YES\n"}) {
    prepare();
    const Result result = onTerminal(multiplexer, arguments, yes);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.out, "RESTORED\n" + file + "\n");
    EXPECT_EQ(result.err, difference + question);
    EXPECT_EQ(contentsOf(file), "# torso\nrest\t1\n");
    EXPECT_FALSE(pathExists(backup));
  }
}

TEST_P(Restoration, ShowsTheDifferenceAndAsks) {
  if (hasTerminals()) {
    expectQuestions("/dev/ptmx");
    return;
  }
  REQUIRE_ROOT("to mount terminals, which are missing here");
  const std::string terminals = temp.dir("terminals");
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("devpts", terminals.c_str(), "devpts", 0, "newinstance"), 0);
              expectQuestions(terminals + "/ptmx");
              return 0;
            }),
            0);
}

TEST_P(Restoration, GoesOnWithoutATerminalOnlyWhenItIsToldTo) {
  prepare();
  const Result without_terminal =
      osutils(arguments, [] { dup2(open("/dev/null", O_RDONLY), STDIN_FILENO); });
  EXPECT_EQ(without_terminal.status, 2);
  EXPECT_THAT(without_terminal.err, HasSubstr("there is no terminal to ask"));
  EXPECT_EQ(contentsOf(file), "# torso\n");

  const Result shown = osutils(command(family.name, "restore", file, {"--dry-run"}));
  EXPECT_EQ(shown.status, 0);
  EXPECT_EQ(shown.out, difference);
  const Result done = osutils(command(family.name, "restore", file, {"--yes", "--json"}));
  EXPECT_EQ(done.status, 0);
  EXPECT_EQ(done.out, "{\"restored\":\"" + file + "\"}\n");
  EXPECT_EQ(done.err, difference);
}

TEST_P(Edits, RestoreKeepsTheFileItselfAndMakesItWhenItIsGone) {
  writeFile(backup, "# copy\n");
  ASSERT_EQ(chmod(file.c_str(), 0640), 0);
  struct stat before = {};
  struct stat after = {};
  ASSERT_EQ(stat(file.c_str(), &before), 0);
  EXPECT_EQ(osutils(command(family.name, "restore", file, {"--yes"})).status, 0);
  ASSERT_EQ(stat(file.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mode, before.st_mode);
  EXPECT_EQ(contentsOf(file), "# copy\n");

  writeFile(backup, "# second copy\n");
  std::filesystem::remove(file);
  EXPECT_EQ(osutils(command(family.name, "restore", file, {"--yes"})).status, 0);
  EXPECT_EQ(contentsOf(file), "# second copy\n");
  EXPECT_FALSE(pathExists(backup));
  expectRefusal(osutils(command(family.name, "restore", file, {"--yes"})),
                error + "restore: no such object (32): there is no copy at " + backup + "\n");
}

TEST_P(Edits, RestoreKeepsTheCopyUntilTheFileIsWhole) {
  const std::string copy = std::string(family.contents) + std::string(500, '#') + "\n";
  writeFile(file, "# torso\n");
  writeFile(backup, copy);
  const Arguments arguments = command(family.name, "restore", file, {"--yes"});
  expectRefusal(osutils(arguments, [] { limitFileSize(100); }), HasSubstr("its limit is 100"));
  EXPECT_EQ(contentsOf(file), "# torso\n");
  EXPECT_EQ(contentsOf(backup), copy);

  const Result stuck = osutils(arguments, [] { withFault("stuck backup"); });
  expectRefusal(stuck, EndsWith(file +
                                " is restored; the copy cannot be removed (Device or resource "
                                "busy): rm -- '" +
                                backup + "'\n"));
  EXPECT_EQ(contentsOf(file), copy);
  EXPECT_EQ(follow(stuck).status, 0);
  EXPECT_FALSE(pathExists(backup));
}

// ---- No room ----

TEST_P(Edits, LeaveTheFileWholeOnAFullDisk) {
  REQUIRE_ROOT("to mount a small file system");
  EXPECT_EQ(withPrivateMounts([&] {
              const std::string disk = temp.dir("disk");
              if (mount("osutils-test", disk.c_str(), "tmpfs", 0, "size=64k") != 0) return 1;
              const std::string on_disk = disk + "/file";
              std::string contents = family.contents;
              contents.resize(4096, '#');
              contents.back() = '\n';  // a full page: another line needs another
              writeFile(on_disk, contents);
              EXPECT_EQ(edit(family, "add", on_disk).status,
                        0);  // the lock takes its room for good
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
              // Room for the copy, but not for the new file too.
              EXPECT_EQ(ftruncate(filler, filled - 4096), 0);
              expectRefusal(edit(family, "delete", on_disk), HasSubstr(": no space left for "));
              EXPECT_EQ(contentsOf(on_disk), contents);
              EXPECT_EQ(ftruncate(filler, filled - 2 * 4096), 0);
              EXPECT_EQ(edit(family, "delete", on_disk).err, "");
              EXPECT_EQ(edit(family, "add", on_disk).err, "");
              close(filler);
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
                  EndsWith("bytes of " + file + ", its limit is " + std::to_string(limit) + "\n"));
    ASSERT_EQ(contentsOf(file), family.contents);
    if (limit % 8 != 0 || limit >= size) continue;
    expectRefusal(
        edit(family, "delete", file, {}, [&] { limitFileSize(limit); }),
        EndsWith("bytes of " + backup + ", its limit is " + std::to_string(limit) + "\n"));
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
      } else if (result.status != 127) {  // the loader's: it could not open the libraries
        expectRefusal(result, Not(""));
        EXPECT_EQ(contentsOf(file), family.contents);
      }
    }
    EXPECT_EQ(done, 1);
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
                             HasSubstr("cannot make a copy of " + file + " in " + temp.path() +
                                       ": Permission denied"));
               expectRefusal(edit(family, "add", file, {}, dropCoverageCounters),
                             HasSubstr("cannot open the lock " + lock + ": Permission denied"));
               EXPECT_EQ(edit(family, "add", file, {"--no-lock"}, dropCoverageCounters).status, 0);
               return ::testing::Test::HasFailure() ? 1 : 0;
             }),
      0);
}

// ---- What no check beforehand can know ----

TEST_P(Edits, AddTakesAPartOfItsLineAway) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("short line"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line could not be written whole; " + file + " is as it was\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, AddTakesALineAwayThatCouldNotBeForcedToTheDisk) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("unforced file"); }),
                error + "add: operations error (1): cannot add \"new\" to " + file +
                    ": its line could not be forced to the disk: Input/output error; " + file +
                    " is as it was\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, DeleteSaysThatTheFileMayNotBeOnTheDisk) {
  for (const bool keep : {true, false}) {
    writeFile(file, family.contents);
    const Result result = edit(family, "delete", file, {}, [] { withFault("unforced file"); });
    const std::string removal = "rm -- '" + backup + "'";
    expectRefusal(
        result, error + "delete: insufficient access (50): cannot delete \"" + family.deletion[0] +
                    "\" from " + file + "; " + file +
                    " is edited, but perhaps not on the disk yet (to keep it so: " + removal +
                    "); " + backup + " is a complete copy; to put it back: osutils " + family.name +
                    " restore --file '" + file + "'\n");
    EXPECT_EQ(contentsOf(file), family.rest);
    EXPECT_EQ(contentsOf(backup), family.contents);
    const Result done = keep ? runProgram({"/bin/sh", "-c", removal}) : follow(result);
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
      EndsWith("cannot force " + file + ": Input/output error; the copy is still at " + backup +
               "; to try again: osutils " + family.name + " restore --file '" + file + "'\n"));
  EXPECT_EQ(contentsOf(backup), family.contents);
  EXPECT_EQ(follow(result).status, 0);
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
                    "\" from " + file + "; " + file + " is as it was\n");
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeletePutsTheFileBackWhenItsCopyIsLost) {
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("unopenable backup"); }),
                error + "delete: insufficient access (50): cannot delete \"" + family.deletion[0] +
                    "\" from " + file + "; " + file + " is as it was\n");
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteSaysHowToPutBackACompleteCopy) {
  const Result result = edit(family, "delete", file, {}, [] { withFault("short rewrite"); });
  expectRefusal(result, error + "delete: insufficient access (50): cannot delete \"" +
                            family.deletion[0] + "\" from " + file + "; " + file +
                            " is not complete; " + backup +
                            " is a complete copy; to put it back: osutils " + family.name +
                            " restore --file '" + file + "'\n");
  EXPECT_EQ(contentsOf(backup), family.contents);
  EXPECT_EQ(follow(result).status, 0);
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_FALSE(pathExists(backup));
}

TEST_P(Edits, DeleteReportsACopyThatItCouldNotRemove) {
  const Result result = edit(family, "delete", file, {}, [] { withFault("stuck backup"); });
  expectRefusal(result,
                error + "delete: operations error (1): " + file +
                    " is edited, as it should be; the copy at " + backup +
                    " is not needed, and cannot be removed (Device or resource busy): rm -- '" +
                    backup + "'\n");
  EXPECT_EQ(contentsOf(file), family.rest);
  EXPECT_EQ(follow(result).status, 0);
  EXPECT_FALSE(pathExists(backup));
}

// ---- Killed at every step ----

// The system calls that change something, or open or close it: between any two others nothing differs.
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

// Runs the tool and kills it before its step `number`, counted from the first look at the lock on. False
// when it ended before, and nothing when it cannot be traced.
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
    setenv("ASAN_OPTIONS", "detect_leaks=0:detect_odr_violation=0", 1);  // it traces too
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
  int steps = -1;  // none before the lock
  long signal = 0;
  for (;;) {
    if (ptrace(PTRACE_SYSCALL, child, nullptr, signal) != 0) return std::nullopt;
    if (waitpid(child, &status, 0) != child) return std::nullopt;
    if (!WIFSTOPPED(status)) return false;
    signal = WSTOPSIG(status);
    if (signal != (SIGTRAP | 0x80)) {
      if (signal == SIGTRAP) signal = 0;  // of execv
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

// The tool killed before each of its steps in turn, until it is fast enough to get to the end. `check`
// looks at what each of them left.
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
  EXPECT_GE(killed, 5);  // otherwise this proves nothing
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
        EXPECT_EQ(follow(next).status, 0);
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

// ---- Dry runs ----

TEST_P(Edits, ADryRunShowsWhatTheEditDoesAndChangesNothing) {
  // Lines that look like the deleted ones, a piece of a long line that is one, and text on both sides.
  std::string contents = "# top\n";
  for (int i = 0; i < 10; ++i) contents += "line" + std::to_string(i) + " # not a line to delete\n";
  contents += family.contents;
  contents += "#" + std::string(1022, '-') + "domain 53/tcp\nl0\n  domain\nl0:x\n\t l0:2:y:z\n";
  contents += "#" + std::string(1022, '-') + "l0:2:off:\n#domain\ndomains 1/tcp\n\n# bottom\n";
  for (const char* name : {"add", "delete"}) {
    SCOPED_TRACE(name);
    writeFile(file, contents);
    const std::string before = stateOf(temp.path());
    const Result shown = edit(family, name, file, {"--dry-run"});
    EXPECT_EQ(shown.status, 0);
    EXPECT_EQ(shown.err, "");
    EXPECT_EQ(stateOf(temp.path()), before);
    EXPECT_EQ(contentsOf(file), contents);

    const std::string old = temp.file("old", contents);
    EXPECT_EQ(edit(family, name, file).status, 0);
    EXPECT_EQ(shown.out,
              runProgram({"/usr/bin/diff", "-u", "--label", file, "--label", file, old, file}).out);
    std::filesystem::remove(old);
    std::filesystem::remove(lock);
  }
  EXPECT_NE(contentsOf(file), contents);
}

TEST_P(Edits, ADryRunFailsWhereTheEditWould) {
  writeFile(backup, "# another\n");
  const std::string before = stateOf(temp.path());
  for (const char* name : {"add", "delete"}) {
    expectRefusal(edit(family, name, file, {"--dry-run"}),
                  HasSubstr("an earlier edit left a copy"));
  }
  EXPECT_EQ(stateOf(temp.path()), before);
}

TEST_P(Edits, ADryRunNeedsNoLock) {
  const Holder holder(lock);
  EXPECT_EQ(edit(family, "add", file, {"--dry-run"}).err, "");
}

// ---- What others read ----

class Services : public ::testing::Test {
 protected:
  Result add(const Arguments& texts, const Arguments& options = {}) const {
    Arguments rest = options;
    rest.insert(rest.end(), texts.begin(), texts.end());
    return osutils(command("services", "add", file, rest));
  }

  const TempDir temp;
  const std::string file =
      temp.file("services", std::string(kServices) + "http 80/tcp www # web\n");
};

TEST_F(Services, DeleteTellsTheLongestNameFromALongerOne) {
  const std::string name(90, 'a');
  const std::string longer = name + "b\t4001/tcp\n";
  writeFile(file, name + "\t4000/tcp\n" + longer);
  const Result result = osutils(command("services", "delete", file, {name}));
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(result.err, "");
  EXPECT_EQ(contentsOf(file), longer);
}

TEST_F(Services, AddRefusesWhatOthersWouldReadOtherwise) {
  const std::string before = contentsOf(file);
  struct Case {
    Arguments texts;
    int status;
    std::string why;
  };
  const Case cases[] = {
      {{"new", "65536"}, 2, "PORT is above 65535, others would read it as 0"},
      {{"new", "70000"}, 2, "PORT is above 65535, others would read it as 4464"},
      {{"new", "400000"}, 2, "PORT is above 65535"},
      {{"ne#w", "4000"}, 2, "NAME has a \"#\" or \"/\", others would not find it"},
      {{"new/udp", "4000"}, 2, "NAME has a \"#\" or \"/\", others would not find it"},
      {{"www", "4000"}, 3, "others would find the line of \"http\" in " + file + " for \"www\""},
      {{"directory", "4000"}, 3, "others would find the line of \"ldap\""},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.why);
    const Result result = add(each.texts);
    EXPECT_EQ(result.status, each.status);
    EXPECT_THAT(result.err, HasSubstr(each.why));
    EXPECT_EQ(contentsOf(file), before);
    EXPECT_EQ(add(each.texts, {"--force"}).status, 0);
    EXPECT_EQ(contentsOf(file), before + each.texts[0] + "\t" + each.texts[1] + "/tcp\n");
    writeFile(file, before);
  }
  for (const Arguments& texts : {Arguments{"remote", "4000"}, Arguments{"web", "4001"}}) {
    EXPECT_EQ(add(texts).status, 0);  // words of comments
  }
}

TEST_F(Services, WhatIsAddedWithoutForceIsFoundByGetent) {
  REQUIRE_ROOT("to put another file in the place of /etc/services");
  if (!pathExists("/usr/bin/getent")) GTEST_SKIP() << "needs getent";
  const std::string contents = contentsOf(file);
  EXPECT_EQ(withPrivateEtc([&] {
              const auto portOf = [](const std::string& name) -> std::string {
                const Result found = runProgram({"/usr/bin/getent", "services", name});
                std::istringstream words(found.out);
                std::string first;
                std::string port;
                words >> first >> port;
                return first == name ? port : first;
              };
              int port = 4000;
              for (const std::string name :
                   {"a", "a.b", "a:b", "a,b", "a\\b", "a'b", "a\"b", "A", "a-", "x11", "a\303\244",
                    "a\205", "a\240", "a\377", "[a]", "a*", "a=b", "web"}) {
                SCOPED_TRACE(name);
                writeFile("/etc/services", contents);
                const std::string number = std::to_string(++port);
                const Result added = osutils({"services", "add", name, number});
                if (name == "[a]") {
                  EXPECT_EQ(added.status, 2);  // begins with no letter
                  continue;
                }
                EXPECT_EQ(added.status, 0) << added.err;
                EXPECT_EQ(portOf(name), number + "/tcp");
              }
              // And what needs --force is not.
              struct Case {
                std::string name;
                std::string port;
                std::string found;
              };
              const Case cases[] = {{"a#b", "4000", ""},
                                    {"a/b", "4000", ""},
                                    {"www", "4000", "http"},
                                    {"big", "70000", "4464/tcp"}};
              for (const Case& each : cases) {
                SCOPED_TRACE(each.name);
                writeFile("/etc/services", contents);
                EXPECT_NE(osutils({"services", "add", each.name, each.port}).status, 0);
                EXPECT_EQ(osutils({"services", "add", "--force", each.name, each.port}).status, 0);
                EXPECT_EQ(portOf(each.name), each.found);
              }
              return ::testing::Test::HasFailure() ? 1 : 0;
            }),
            0);
}

TEST(InittabActions, AddRefusesWhatInitDoesNotKnow) {
  const TempDir temp;
  const std::string file = temp.file("inittab", kInittab);
  const auto add = [&](const std::string& action, const Arguments& options = {}) {
    Arguments rest = options;
    rest.insert(rest.end(), {"new", "2", action, "/x"});
    return osutils(command("inittab", "add", file, rest));
  };
  for (const char* action : {"", "Respawn", "respawn ", "start", "waiting"}) {
    SCOPED_TRACE(action);
    const Result result = add(action);
    EXPECT_EQ(result.status, 2);
    EXPECT_THAT(result.err, HasSubstr("ACTION is none that init knows"));
    EXPECT_EQ(contentsOf(file), kInittab);
    EXPECT_EQ(add(action, {"--force"}).status, 0);
    writeFile(file, kInittab);
  }
  for (const char* action :
       {"respawn", "wait", "once", "boot", "bootwait", "off", "ondemand", "initdefault", "sysinit",
        "powerwait", "powerfail", "powerokwait", "powerfailnow", "ctrlaltdel", "kbrequest"}) {
    SCOPED_TRACE(action);
    EXPECT_EQ(add(action).status, 0);
    writeFile(file, kInittab);
  }
}

// ---- Free ports ----

// A socket that listens on the port, or one that is only bound to it.
int listenOn(int family, int port, bool on_loopback) {
  const int descriptor = socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int on = 1;
  setsockopt(descriptor, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
  sockaddr_in6 address6 = {};
  sockaddr_in address4 = {};
  int bound = 0;
  if (family == AF_INET6) {
    setsockopt(descriptor, IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof on);
    address6.sin6_family = AF_INET6;
    address6.sin6_port = htons(static_cast<uint16_t>(port));
    if (on_loopback) address6.sin6_addr = in6addr_loopback;
    bound = bind(descriptor, reinterpret_cast<sockaddr*>(&address6), sizeof address6);
  } else {
    address4.sin_family = AF_INET;
    address4.sin_port = htons(static_cast<uint16_t>(port));
    if (on_loopback) address4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bound = bind(descriptor, reinterpret_cast<sockaddr*>(&address4), sizeof address4);
  }
  return bound == 0 && listen(descriptor, 1) == 0 ? descriptor : -1;
}

void raiseLoopback() {
  const int descriptor = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ifreq request = {};
  strcpy(request.ifr_name, "lo");
  request.ifr_flags = IFF_UP;
  EXPECT_EQ(ioctl(descriptor, SIOCSIFFLAGS, &request), 0) << strerror(errno);
  close(descriptor);
}

TEST_F(Services, FreePortStopsAtTheLastPortOfTcp) {
  writeFile(file, "a 65534/tcp\nb 65535/udp\n");
  EXPECT_THAT(osutils(command("services", "free-port", file, {"65534"})).err,
              HasSubstr("unavailable (52): no free port from 65534 to 65535 in " + file));
  EXPECT_EQ(osutils(command("services", "free-port", file, {"65533"})).out, "PORT\n65533\n");
}

TEST_F(Services, FreePortPassesOverPortsThatAreInUse) {
  REQUIRE_ROOT("for a network of its own");
  EXPECT_EQ(
      withPrivateNetwork([&] {
        raiseLoopback();
        const auto first = [&](const std::string& start, const std::function<void()>& prepare) {
          return osutils(command("services", "free-port", file, {"--unused", start}), prepare);
        };
        const auto plain = [] {};
        EXPECT_EQ(first("4000", plain).out, "PORT\n4000\n");
        EXPECT_NE(listenOn(AF_INET, 4000, false), -1);
        EXPECT_NE(listenOn(AF_INET, 4001, true), -1);
        const bool has_ipv6 = listenOn(AF_INET6, 4002, false) != -1;
        if (has_ipv6) {
          EXPECT_NE(listenOn(AF_INET6, 4003, true), -1);
        }
        EXPECT_EQ(first("4000", plain).out, has_ipv6 ? "PORT\n4004\n" : "PORT\n4002\n");
        EXPECT_EQ(osutils(command("services", "free-port", file, {"4000"})).out, "PORT\n4000\n");
        EXPECT_EQ(first("4000", [] { failSystemCall(SYS_socket, 0, AF_INET6, EAFNOSUPPORT); }).out,
                  "PORT\n4002\n");
        EXPECT_EQ(first("4000", [] { failSystemCall(SYS_socket, 0, AF_INET, EAFNOSUPPORT); }).out,
                  has_ipv6 ? "PORT\n4000\n" : "");
        EXPECT_NE(listenOn(AF_INET, 65535, false), -1);
        EXPECT_EQ(first("65535", plain).status, 3);
        EXPECT_EQ(first("389", plain).out, "PORT\n390\n");
        return ::testing::Test::HasFailure() ? 1 : 0;
      }),
      0);
}

TEST_F(Services, FreePortPassesOverPortsThatTheCallerMayNotBind) {
  REQUIRE_OTHER_USERS();
  EXPECT_EQ(withPrivateNetwork([&] {
              return asUser(kNobody, [&] {
                const Result result =
                    osutils(command("services", "free-port", file, {"--unused", "1000"}),
                            dropCoverageCounters);
                EXPECT_EQ(result.out, "PORT\n1024\n");
                return ::testing::Test::HasFailure() ? 1 : 0;
              });
            }),
            0);
}

}  // namespace
