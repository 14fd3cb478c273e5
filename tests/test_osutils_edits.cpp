// Edits of the services file and the inittab file: the lock, the backup and its restoration.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <list>
#include <string>
#include <thread>
#include <vector>

#include "files.h"
#include "process_namespace.h"
#include "tool.h"
#include "tool_edits.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

// ---- The lock ----

INSTANTIATE_TEST_SUITE_P(Families, Edits, ::testing::ValuesIn(kFamilies),
                         [](const auto& each) { return std::string(each.param.name); });

TEST_P(Edits, TheLockHoldsTheProcessAndItsCommandAndStays) {
  writeFile(lock, std::string(2000, 'x'));
  for (const char* name : {"add", "delete"}) {
    EXPECT_EQ(edit(family, name, file, {"--json"}).status, 0);
    const std::string text = contentsOf(lock);
    EXPECT_GT(atoi(text.c_str()), 0);
    EXPECT_THAT(text, AllOf(HasSubstr(std::string(" ") + OSUTILS_TOOL + " " + family.name + " " +
                                      name + " --file " + file),
                            EndsWith("\n")));
  }
}

TEST_P(Edits, MakeTheLockForItsOwnerAlone) {
  EXPECT_EQ(edit(family, "add", file, {}, [] { umask(0777); }).status, 0);
  EXPECT_EQ(modeOf(lock), 0600U);
  std::filesystem::remove(lock);
  EXPECT_EQ(edit(family, "delete", file, {}, [] { umask(0); }).status, 0);
  EXPECT_EQ(modeOf(lock), 0600U);
}

TEST_P(Edits, RecordTheFirst500CharactersOfTheCommand) {
  std::string long_path = file;
  long_path.insert(long_path.rfind('/'), std::string(500, '/'));
  EXPECT_EQ(edit(family, "add", long_path).status, 0);
  const std::string text = contentsOf(lock);
  EXPECT_EQ(text.size(), text.find(' ') + 1 + 500 + 1);
  EXPECT_THAT(text, EndsWith("//\n"));
}

TEST_P(Edits, WorkOnAFileInTheCurrentFolder) {
  for (const char* name : {"add", "delete"}) {
    const auto inside = [this] { (void)!chdir(temp.path().c_str()); };
    EXPECT_EQ(edit(family, name, "the file", {}, inside).err, "");
  }
  EXPECT_EQ(contentsOf(file), std::string(family.rest) + family.added);
  EXPECT_TRUE(pathExists(lock));
}

TEST_P(Edits, WaitForTheLockAndNameItsHolder) {
  for (const char* name : {"add", "delete"}) {
    SCOPED_TRACE(name);
    LockHolder holder(lock);
    int err[2];
    ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
    Result result;
    std::thread waiting(
        [&] { result = edit(family, name, file, {}, [&] { dup2(err[1], STDERR_FILENO); }); });
    std::string line;
    for (char c = 0; c != '\n' && read(err[0], &c, 1) == 1;) line += c;
    EXPECT_EQ(line, "osutils: waiting up to 15 s for " + lock + ": process " +
                        std::to_string(holder.process()) + " (backup ?? of files) holds it\n");
    EXPECT_EQ(contentsOf(file), family.contents);
    holder.release();
    waiting.join();
    close(err[0]);
    close(err[1]);
    EXPECT_EQ(result.status, 0);
    writeFile(file, family.contents);
  }
}

// Runs the command until it has printed a line, and returns that line.
std::string firstLineOf(Arguments arguments) {
  int err[2];
  if (pipe2(err, O_CLOEXEC) != 0) return "";
  arguments.insert(arguments.begin(), OSUTILS_TOOL);
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  const pid_t child = fork();
  if (child == 0) {
    dup2(err[1], STDERR_FILENO);
    execv(argv[0], argv.data());
    _exit(126);
  }
  close(err[1]);
  std::string line;
  for (char c = 0; c != '\n' && read(err[0], &c, 1) == 1;) line += c;
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  close(err[0]);
  return line;
}

TEST_P(Edits, NameTheProcessThatHoldsTheLockAndNotTheLastOne) {
  const Arguments addition = command(family.name, "add", file, family.addition);
  for (const char* record : {"", "1 former command\n", "text", "\n1 former\n"}) {
    SCOPED_TRACE(record);
    std::filesystem::remove(lock);
    const LockHolder holder(lock, record);
    EXPECT_EQ(firstLineOf(addition), "osutils: waiting up to 15 s for " + lock + ": process " +
                                         std::to_string(holder.process()) + " holds it\n");
  }
}

// There the system does not say which process it is.
TEST_P(Edits, NameTheRecordedProcessForAHolderInAnotherNamespace) {
  REQUIRE_PROCESS_NAMESPACE();
  const Arguments addition = command(family.name, "add", file, family.addition);
  const std::pair<std::string, std::string> cases[] = {
      {"12 former command\n", "process 12 (former command)"},
      {"12 \n", "process 12 ()"},
      {"12", "process 12 ()"},
      {"", "another process"}};
  for (const auto& [record, shown] : cases) {
    std::filesystem::remove(lock);
    const LockHolder holder(lock, record);
    inProcessNamespace([&, wanted = shown] {
      EXPECT_EQ(firstLineOf(addition),
                "osutils: waiting up to 15 s for " + lock + ": " + wanted + " holds it\n");
    });
  }
}

TEST_P(Edits, LockTheSuccessorOfALockThatWasRemoved) {
  LockHolder holder(lock);
  int err[2];
  ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
  Result result;
  std::thread waiting(
      [&] { result = edit(family, "add", file, {}, [&] { dup2(err[1], STDERR_FILENO); }); });
  char first = 0;
  EXPECT_EQ(read(err[0], &first, 1), 1);
  std::filesystem::remove(lock);
  holder.release();
  waiting.join();
  close(err[0]);
  close(err[1]);
  EXPECT_EQ(result.status, 0);
  EXPECT_THAT(contentsOf(lock), HasSubstr(std::string(OSUTILS_TOOL) + " " + family.name + " add"));
}

// Both families at once, because each waits for so long.
TEST(EditsOfEachFamily, FailWhenTheLockIsNotReleased) {
  const TempDir temp;
  std::list<LockHolder> holders;
  for (const Family& family : kFamilies) {
    holders.emplace_back(temp.file(family.name, family.contents) + ".lock");
  }
  std::vector<std::thread> waiting;
  auto holder = holders.begin();
  for (const Family& family : kFamilies) {
    waiting.emplace_back([&temp, &family, id = (holder++)->process()] {
      SCOPED_TRACE(family.name);
      const std::string file = temp.path(family.name);
      const auto start = std::chrono::steady_clock::now();
      const Result result = edit(family, "delete", file);
      EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(15));
      const std::string process = "process " + std::to_string(id) + " (backup ?? of files)";
      expectRefusal(result, "osutils: waiting up to 15 s for " + file + ".lock: " + process +
                                " holds it\nosutils: " + family.name +
                                " delete: unavailable (52): " + process + " still holds the lock " +
                                file + ".lock\n");
      EXPECT_EQ(contentsOf(file), family.contents);
    });
  }
  for (std::thread& each : waiting) each.join();
}

TEST_P(Edits, TakeNoLockOnRequest) {
  const LockHolder holder(lock);
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
  const LockHolder holder(lock);
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

TEST_P(Edits, RefuseALockThatIsNotAFileOfItsOwn) {
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
  expectRefused(" has several hard links");
  ASSERT_EQ(mkfifo(lock.c_str(), 0600), 0);
  expectRefused(" is not a regular file");
  temp.dir("the file.lock");
  expectRefusal(
      edit(family, "add", file),
      error + "add: operations error (1): cannot open the lock " + lock + ": Is a directory\n");
}

TEST_P(Edits, SayWhyTheyGetNoLock) {
  expectRefusal(edit(family, "add", file, {}, [] { withFault("forbidden lock"); }),
                error + "add: insufficient access (50): cannot open the lock " + lock +
                    ": Operation not permitted\n");
  expectRefusal(edit(family, "delete", file, {}, [] { withFault("no locks"); }),
                error + "delete: operations error (1): cannot take the lock " + lock +
                    ": No locks available\n");
  EXPECT_EQ(contentsOf(file), family.contents);
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

// ---- Backups of earlier edits ----

TEST_P(Edits, StopAtACopyAndSayHowToPutItBack) {
  const std::string whole = std::string(family.contents) + "\n# more\n";
  for (const char* name : {"add", "delete"}) {
    SCOPED_TRACE(name);
    writeFile(file, "# torso\n");
    writeFile(backup, whole);
    const Result result = edit(family, "add", file);
    expectRefusal(
        result, error + "add: unwilling to perform (53): an earlier edit left a copy at " + backup +
                    ", and " + file +
                    " may have lost lines since; to compare them and restore the copy: osutils " +
                    family.name + " restore --file '" + file + "'\n");
    expectRefusal(edit(family, "delete", file), HasSubstr("an earlier edit left a copy"));
    EXPECT_EQ(contentsOf(file), "# torso\n");
    EXPECT_EQ(runRecommended(result).status, 0);
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
    const Result removal = runRecommended(result);
    EXPECT_EQ(removal.status, 0);
    EXPECT_EQ(removal.out, "REMOVED\n" + backup + "\n");
    EXPECT_EQ(contentsOf(file), whole);
    EXPECT_FALSE(pathExists(backup));
  }
  writeFile(backup, whole.substr(0, 10));
  EXPECT_EQ(osutils(command(family.name, "restore", file, {"--force", "--yes"})).status, 0);
  EXPECT_EQ(contentsOf(file), whole.substr(0, 10));
}

TEST_P(Edits, RefuseWhatIsNotACopyAtTheBackupPath) {
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
  expectRefused(" is a symbolic link");
  ASSERT_EQ(symlink("nowhere", backup.c_str()), 0);
  expectRefused(" is a symbolic link");
  ASSERT_EQ(symlink(file.c_str(), backup.c_str()), 0);
  expectRefused(" is the file itself");
  ASSERT_EQ(link(file.c_str(), backup.c_str()), 0);
  expectRefused(" is the file itself");
  ASSERT_EQ(mkfifo(backup.c_str(), 0600), 0);
  expectRefused(" is a FIFO");
  ASSERT_EQ(mkdir(backup.c_str(), 0700), 0);
  expectRefused(" is a directory");
  makeSocket(backup);
  expectRefused(" is a socket");
  if (mknod(backup.c_str(), S_IFCHR | 0600, makedev(1, 3)) == 0) expectRefused(" is a device");
}

TEST_P(Edits, RefuseABackupPathThatCannotBeLookedAt) {
  const std::string below = file + "/below";
  const std::string why = below + ": Not a directory\n";
  for (const char* name : {"add", "delete"}) {
    expectRefusal(
        edit(family, name, file, {"--backup", below}),
        error + name + ": insufficient access (50): cannot look at the backup path " + why);
  }
  expectRefusal(osutils(command(family.name, "restore", file, {"--backup", below, "--yes"})),
                error + "restore: insufficient access (50): cannot look at " + why);
}

// What the tool recommends can be given to a shell.
TEST_P(Edits, QuoteWhatAShellWouldNotTakeAsItStands) {
  const std::pair<std::string, std::string> cases[] = {{"aZ09._-+:@%,", "aZ09._-+:@%,"},
                                                       {"it's", "'it'\\''s'"},
                                                       {"a&b", "'a&b'"},
                                                       {"a[", "'a['"},
                                                       {"a`", "'a`'"},
                                                       {"a{", "'a{'"},
                                                       {"a~", "'a~'"},
                                                       {"a=", "'a='"},
                                                       {"a;", "'a;'"}};
  for (const auto& [name, quoted] : cases) {
    SCOPED_TRACE(name);
    const std::string path = temp.file(name, "# torso\n");
    writeFile(temp.path("copy"), family.contents);
    const std::string shown =
        quoted[0] == '\'' ? "'" + temp.path() + "/" + quoted.substr(1) : temp.path(quoted);
    const Result result = edit(family, "add", path, {"--backup", temp.path("copy")});
    expectRefusal(result, EndsWith(": osutils " + std::string(family.name) + " restore --file " +
                                   shown + " --backup " + temp.path("copy") + "\n"));
    EXPECT_EQ(runRecommended(result).status, 0);
    EXPECT_EQ(contentsOf(path), family.contents);
    EXPECT_FALSE(pathExists(temp.path("copy")));
  }
}

TEST_P(Edits, RefuseAnEmptyBackupPath) {
  for (const char* name : {"add", "delete"}) {
    expectFailure(edit(family, name, file, {"--backup", ""}),
                  error + name + ": parameter error (89): --backup is empty\n");
  }
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Edits, DiscardACopyOnRequest) {
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
    // With an unreadable backup a deletion would empty the file.
    ASSERT_EQ(chown(backup.c_str(), kNobody, kNobody), 0);
    ASSERT_EQ(chmod(backup.c_str(), 0200), 0);
    as_nobody(name, {"--discard-backup"}, "cannot read " + backup + ": Permission denied");
    as_nobody(name, {},
              ", which cannot be read: Permission denied; to make it readable: chmod u+r -- '" +
                  backup + "'\n");
    ASSERT_EQ(chown(backup.c_str(), 0, 0), 0);
    as_nobody(name, {}, ", which cannot be read: Permission denied\n");
  }
  EXPECT_EQ(contentsOf(file), family.contents);
  EXPECT_EQ(contentsOf(backup), "# another\n");
}

TEST_P(Edits, SayThatTheyCouldNotDiscardACopy) {
  writeFile(backup, "# another\n");
  for (const char* name : {"add", "delete"}) {
    expectRefusal(edit(family, name, file, {"--discard-backup"}, [] { withFault("stuck backup"); }),
                  error + name + ": operations error (1): cannot remove " + backup +
                      ": Device or resource busy\n");
  }
  EXPECT_EQ(contentsOf(file), family.contents);
}

// ---- Restoration ----

// Answers the tool's question on a new terminal of `multiplexer`.
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

// What changes while the tool waits for an answer is not overwritten.
TEST_P(Restoration, DoesNothingIfAFileChangedWhileItAsked) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  for (const std::string& changed : {file, backup}) {
    prepare();
    const Terminal terminal = openTerminal();
    int err[2];
    ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
    Result result;
    std::thread asked([&] {
      result = osutils(arguments, [&] {
        dup2(terminal.subsidiary, STDIN_FILENO);
        dup2(err[1], STDERR_FILENO);
      });
      close(err[1]);
    });
    std::string shown;
    for (char c = 0; !shown.ends_with("[y/N] ") && read(err[0], &c, 1) == 1;) shown += c;
    writeFile(changed, "# changed\n");
    EXPECT_EQ(write(terminal.manager, "y\n", 2), 2);
    asked.join();
    close(terminal.subsidiary);
    close(terminal.manager);
    EXPECT_EQ(result.status, 3);
    EXPECT_EQ(readAll(err[0]), error +
                                   "restore: unwilling to perform (53): one of the files changed "
                                   "meanwhile; nothing was done\n");
    EXPECT_EQ(contentsOf(changed), "# changed\n");
    EXPECT_TRUE(pathExists(backup));
  }
}

TEST_P(Restoration, ShowsNoControlCharacters) {
  writeFile(file, "a\n");
  writeFile(backup, "a\nb\033\tc\n");
  const Result done = osutils(command(family.name, "restore", file, {"--yes"}));
  EXPECT_THAT(done.err, EndsWith("\n a\n+b?\tc\n"));
}

TEST_P(Restoration, AsksBeforeItRemovesACopyThatIsOfNoUse) {
  if (!hasTerminals()) GTEST_SKIP() << "there are no terminals";
  writeFile(backup, family.contents);
  const std::string question =
      "all of " + backup + " is in " + file + "\nRemove " + backup + "? [y/N] ";
  expectRefusal(onTerminal("/dev/ptmx", arguments, "n\n"),
                question + error + "restore: unwilling to perform (53): nothing was changed\n");
  EXPECT_EQ(contentsOf(backup), family.contents);
  const Result done = onTerminal("/dev/ptmx", arguments, "yes\n");
  EXPECT_EQ(done.err, question);
  EXPECT_EQ(done.out, "REMOVED\n" + backup + "\n");
  EXPECT_EQ(contentsOf(file), family.contents);
}

TEST_P(Restoration, RefusesWhatItCannotPutBack) {
  const std::string refused = error + "restore: unwilling to perform (53): ";
  ASSERT_EQ(link(file.c_str(), backup.c_str()), 0);
  expectRefusal(osutils(command(family.name, "restore", file, {"--yes"})),
                refused + "the backup path " + backup + " is the file itself\n");
  std::filesystem::remove(backup);
  ASSERT_EQ(symlink("nowhere", backup.c_str()), 0);
  expectRefusal(osutils(command(family.name, "restore", file, {"--yes"})),
                refused + backup + " is a symbolic link\n");
  std::filesystem::remove(backup);
  writeFile(backup, family.contents);
  std::filesystem::remove(file);
  temp.dir("the file");
  expectRefusal(osutils(command(family.name, "restore", file, {"--yes"})),
                refused + file + " is not a regular file\n");
  EXPECT_EQ(contentsOf(backup), family.contents);
}

TEST_P(Restoration, SaysWhatAnotherUserMayNot) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  prepare();
  const auto refused = [&](const std::string& line) {
    asNobody([&] {
      const Result result = osutils(command(family.name, "restore", file, {"--no-lock", "--yes"}),
                                    dropCoverageCounters);
      EXPECT_EQ(result.status, 3);
      EXPECT_THAT(result.err, EndsWith(error + "restore: " + line));
    });
  };
  const auto refusedByADryRun = [&](const std::string& what) {
    asNobody([&] {
      const Result result =
          osutils(command(family.name, "restore", file, {"--dry-run"}), dropCoverageCounters);
      EXPECT_EQ(result.status, 3);
      EXPECT_EQ(result.err, error + "restore: insufficient access (50): cannot " + what +
                                ": Permission denied\n");
    });
  };
  refused("operations error (1): cannot write " + file +
          ": Permission denied; the copy is still at " + backup + "; to try again: osutils " +
          family.name + " restore --file '" + file + "'\n");
  refusedByADryRun("write " + file);
  ASSERT_EQ(chmod(file.c_str(), 0666), 0);
  refusedByADryRun("remove " + backup);
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);
  refused("operations error (1): cannot read " + file + ": Permission denied\n");
  ASSERT_EQ(chmod(backup.c_str(), 0600), 0);
  refused("insufficient access (50): cannot read " + backup + ": Permission denied\n");
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
  expectRefusal(osutils(arguments, [] { withFault("stuck backup"); }),
                EndsWith(file +
                         " is complete; the copy cannot be removed (Device or resource busy): rm "
                         "-- '" +
                         backup + "'\n"));
  EXPECT_EQ(runRecommended(stuck).status, 0);
  EXPECT_FALSE(pathExists(backup));
}

}  // namespace
