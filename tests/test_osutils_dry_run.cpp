// --dry-run: the tool shows what would change, and changes nothing.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "tool.h"
#include "tool_edits.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;

class DryRun : public ::testing::Test {
 protected:
  DryRun() {
    temp.dir("tree");
    temp.file("tree/a", "a");
    temp.file("vrarun", "#!/bin/sh\ntouch started\n");
    (void)chmod(temp.path("vrarun").c_str(), 0755);
  }

  Result here(Arguments arguments) const {
    return osutils(std::move(arguments), [this] { (void)!chdir(temp.path().c_str()); });
  }

  // Every entry below the scratch directory with its metadata.
  std::vector<std::string> world() const {
    std::vector<std::string> entries;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(temp.path())) {
      struct stat status = {};
      EXPECT_EQ(lstat(entry.path().c_str(), &status), 0);
      entries.push_back(entry.path().string() + " " + std::to_string(status.st_ino) + " " +
                        std::to_string(status.st_mode) + " " + std::to_string(status.st_uid) + " " +
                        std::to_string(status.st_size) + " " +
                        std::to_string(status.st_mtim.tv_nsec) + " " +
                        std::to_string(status.st_ctim.tv_nsec));
    }
    std::sort(entries.begin(), entries.end());
    return entries;
  }

  const TempDir temp;
  const std::string file = temp.file("file", "kept");
  const std::string link = [this] {
    const std::string path = temp.path("link");
    (void)!symlink("nowhere", path.c_str());
    return path;
  }();
};

TEST_F(DryRun, ShowsWhatWouldChangeAndChangesNothing) {
  struct Case {
    Arguments words;
    Arguments rest;
    std::string answer;
  };
  const std::string pid = std::to_string(getpid());
  const Case cases[] = {
      {{"file", "copy"},
       {"file", "new"},
       R"({"would":"create","source":"file","destination":"new"})"},
      {{"file", "copy"},
       {"file", "tree/a"},
       R"({"would":"overwrite","source":"file","destination":"tree/a"})"},
      {{"file", "create"},
       {"--owner", "root", "new"},
       R"({"would":"create","path":"new","owner":"root","mode":"0640"})"},
      {{"file", "create"},
       {"--force", "--mode", "600", "file"},
       R"({"would":"replace","path":"file","mode":"0600"})"},
      {{"file", "create"},
       {"--force", "link"},
       R"({"would":"replace","path":"link","mode":"0640"})"},
      {{"file", "delete"}, {"file"}, R"({"would":"delete","path":"file"})"},
      {{"file", "delete"}, {"link"}, R"({"would":"delete","path":"link"})"},
      {{"file", "clear"}, {"file"}, R"({"would":"empty","path":"file","bytes":4})"},
      {{"file", "clear"}, {"new"}, R"({"would":"create","path":"new"})"},
      {{"file", "clear"}, {"link"}, R"({"would":"create","path":"link"})"},
      {{"dir", "create"}, {"new"}, R"({"would":"create","path":"new","mode":"0750"})"},
      {{"dir", "create"}, {"new//"}, R"({"would":"create","path":"new//","mode":"0750"})"},
      {{"dir", "create"},
       {"--mode", "7777", "--group", "root", "new"},
       R"({"would":"create","path":"new","group":"root","mode":"7777"})"},
      {{"dir", "delete"}, {"--force", "tree"}, R"({"would":"delete","path":"tree","entries":1})"},
      {{"process", "start"},
       {"--launcher-dir", temp.path(), "inst1", "-n"},
       R"({"would":"run","launcher":")" + temp.path("vrarun") + R"(","arguments":"inst1 -n"})"},
      {{"process", "stop"}, {pid}, R"({"would":"kill","pid":")" + pid + R"("})"},
  };
  for (const Case& each : cases) {
    Arguments typed = each.words;
    typed.insert(typed.end(), {"--dry-run", "--json"});
    typed.insert(typed.end(), each.rest.begin(), each.rest.end());
    SCOPED_TRACE(::testing::PrintToString(typed));
    const auto before = world();
    expectAnswer(here(typed), each.answer + "\n");
    EXPECT_EQ(world(), before);
  }
}

TEST_F(DryRun, OwnerShowsAllThreeThatWouldBeSet) {
  const auto before = world();
  const Result result = here({"file", "owner", "--dry-run", "--json", "--mode", "600", "file"});
  EXPECT_EQ(result.status, 0);
  EXPECT_THAT(result.out,
              ::testing::MatchesRegex(R"(\{"would":"set","path":"file","owner":".+","group":".+",)"
                                      R"("mode":"0600"\}.)"));
  EXPECT_EQ(world(), before);
}

TEST_F(DryRun, AnEmptyDirectoryWouldBeDeletedWithoutForce) {
  temp.dir("empty");
  expectAnswer(here({"dir", "delete", "--dry-run", "--json", "empty"}),
               "{\"would\":\"delete\",\"path\":\"empty\",\"entries\":0}\n");
  EXPECT_TRUE(pathExists(temp.path("empty")));
}

TEST_F(DryRun, OfALinkToADirectoryNoEntriesWouldBeDeleted) {
  ASSERT_EQ(symlink("tree", temp.path("leads").c_str()), 0);
  expectAnswer(here({"dir", "delete", "--force", "--dry-run", "--json", "leads"}),
               "{\"would\":\"delete\",\"path\":\"leads\",\"entries\":0}\n");
  EXPECT_TRUE(pathExists(temp.path("leads/a")));
}

TEST_F(DryRun, FailsWhereTheCommandWould) {
  struct Case {
    Arguments command;
    std::string line;
  };
  const auto result = [](const std::string& what, const std::string& code, const char* path) {
    return what + "; checkFilePerms returns " + code + " for " + path;
  };
  (void)temp.dir("empty");
  const std::string missing = "no such object (32)";
  const std::string not_a_file = "constraint violation (19)";
  const std::string no_folder = "insufficient access (50): missing: No such file or directory";
  const std::string empty = missing + ": the path is empty";
  const std::string exists = " exists; --force replaces it with an empty file";
  const Case cases[] = {
      {{"file", "copy", "missing", "new"},
       result("cannot copy missing to new", missing, "missing")},
      {{"file", "copy", "file", "missing/new"}, no_folder},
      {{"file", "copy", "file", "link/"},
       "insufficient access (50): link: No such file or directory"},
      {{"file", "copy", "file", "file"},
       "unwilling to perform (53): file and file are the same file"},
      {{"file", "copy", "tree", "new"}, result("cannot copy tree to new", not_a_file, "tree")},
      {{"file", "copy", "file", ""}, empty},
      {{"file", "copy", "file", "tree"}, result("cannot copy file to tree", not_a_file, "tree")},
      {{"file", "create", "file"}, "already exists (68): file" + exists},
      {{"file", "create", "link"}, "already exists (68): link" + exists},
      {{"file", "create", "missing/new"}, no_folder},
      {{"file", "create", ""}, empty},
      {{"file", "create", "tree"}, result("cannot create tree", not_a_file, "tree")},
      {{"file", "create", "--force", "tree"}, result("cannot create tree", not_a_file, "tree")},
      {{"file", "create", "--mode", "9", "x"},
       "parameter error (89): --mode is not an octal mode from 0 to 7777: \"9\""},
      {{"file", "copy", "file", "file/new"},
       "cannot copy file to file/new; checkFilePerms returns no such object (32) for file/new"},
      {{"file", "delete", "missing"}, result("cannot delete missing", missing, "missing")},
      {{"file", "delete", "tree"}, result("cannot delete tree", not_a_file, "tree")},
      {{"file", "clear", "tree"}, result("cannot clear tree", not_a_file, "tree")},
      {{"file", "clear", "missing/new"}, no_folder},
      {{"file", "clear", ""}, empty},
      {{"file", "owner", "--mode", "600", "missing"},
       result("cannot determine the owner and group of missing", missing, "missing")},
      {{"file", "owner", "--mode", "600", "--owner", "root", "--group", "root", "missing"},
       result("cannot set the owner, group and mode of missing", missing, "missing")},
      {{"dir", "create", "tree"}, result("cannot create tree", not_a_file, "tree")},
      {{"dir", "create", "missing/new"}, no_folder},
      {{"dir", "create", "link/"}, result("cannot create link/", missing, "link/")},
      {{"dir", "create", ""}, empty},
      {{"dir", "delete", "tree"}, result("cannot delete tree", not_a_file, "tree")},
      {{"dir", "delete", "missing"}, result("cannot delete missing", missing, "missing")},
      {{"dir", "delete", "file"}, "operations error (1): cannot delete file"},
      {{"dir", "delete", "empty/."}, result("cannot delete empty/.", not_a_file, "empty/.")},
      {{"dir", "delete", "--force", "tree/./"},
       result("cannot delete tree/.", not_a_file, "tree/.")},
      {{"dir", "delete", "--force", "tree/.."},
       result("cannot delete tree/..", not_a_file, "tree/..")},
      {{"dir", "delete", "--force", "file"}, "operations error (1): cannot delete file"},
      {{"dir", "delete", "--force", "a b"},
       "parameter error (89): the path is not a plain shell word: \"a b\""},
      {{"process", "start", "--launcher-dir", "tree", "a"},
       "operations error (1): tree/vrarun: No such file or directory"},
      {{"process", "start", "a;b"},
       "parameter error (89): cannot start with the arguments \"a;b\""},
      {{"process", "stop", "2147483647"},
       "operations error (1): cannot stop process 2147483647: No such process"},
      {{"process", "stop", "0"}, "parameter error (89): PID is not a process id: \"0\""},
  };
  for (const Case& each : cases) {
    Arguments command = each.command;
    SCOPED_TRACE(::testing::PrintToString(command));
    command.insert(command.begin() + 2, "--dry-run");
    const auto before = world();
    const Result shown = here(command);
    expectFailure(shown, "osutils: " + command[0] + " " + command[1] + ": " + each.line + "\n");
    EXPECT_EQ(world(), before);
    // Without the dry run too, except for commands that would end a process.
    if (command[0] == "process") continue;
    command.erase(command.begin() + 2);
    EXPECT_EQ(here(command).status, shown.status);
  }
}

TEST_F(DryRun, TellsAnotherUserWhatIsNotAllowed) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  const std::string open_to_all = temp.dir("open");
  ASSERT_EQ(chmod(open_to_all.c_str(), 0777), 0);
  struct Case {
    Arguments command;
    std::string line;
  };
  const std::string denied = ": Permission denied";
  const std::string folder = "insufficient access (50): " + temp.path() + denied;
  const std::string pid = std::to_string(getpid());
  const Case cases[] = {
      {{"file", "copy", file, temp.path("new")}, folder},
      {{"file", "copy", "/etc/passwd", file}, "insufficient access (50): " + file + denied},
      {{"file", "create", temp.path("new")}, folder},
      {{"file", "create", "--force", file}, folder},
      {{"file", "delete", file}, folder},
      {{"file", "clear", file}, "insufficient access (50): " + file + denied},
      {{"file", "clear", temp.path("new")}, folder},
      {{"file", "owner", "--mode", "600", file},
       "insufficient access (50): " + file + " belongs to another user"},
      {{"dir", "create", temp.path("new")}, folder},
      {{"dir", "delete", "--force", temp.path("tree")}, folder},
      {{"dir", "delete", open_to_all + "/"}, folder},
      {{"process", "stop", pid},
       "operations error (1): cannot stop process " + pid + ": Operation not permitted"},
  };
  asNobody([&] {
    for (const Case& each : cases) {
      Arguments command = each.command;
      SCOPED_TRACE(::testing::PrintToString(command));
      command.insert(command.begin() + 2, "--dry-run");
      expectFailure(osutils(command, dropCoverageCounters),
                    "osutils: " + command[0] + " " + command[1] + ": " + each.line + "\n");
    }
  });
}

TEST_F(DryRun, FailsIfTheEntriesOfADirectoryCannotBeCounted) {
  REQUIRE_OTHER_USERS();
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  const std::string open_to_all = temp.dir("open");
  const std::string tree = temp.dir("open/tree");
  temp.dir("open/tree/hidden");
  temp.file("open/tree/hidden/a", "a");
  ASSERT_EQ(chmod(open_to_all.c_str(), 0777), 0);
  ASSERT_EQ(chmod(temp.path("open/tree/hidden").c_str(), 0700), 0);
  EXPECT_EQ(
      asUser(kNobody,
             [&] {
               expectFailure(
                   osutils({"dir", "delete", "--dry-run", "--force", tree}, dropCoverageCounters),
                   HasSubstr("cannot count the entries of " + tree + ": Permission denied"));
               return ::testing::Test::HasFailure() ? 1 : 0;
             }),
      0);
}

TEST_F(DryRun, CommandsThatChangeNothingHaveNone) {
  for (const Arguments& command :
       {Arguments{"file", "stat"}, Arguments{"services", "list"}, Arguments{"user", "exists"}}) {
    Arguments typed = command;
    typed.push_back("--dry-run");
    expectFailure(osutils(typed), HasSubstr("unknown option \"--dry-run\""));
  }
}

// ---- Edits ----

size_t linesIn(const std::string& text) {
  return static_cast<size_t>(std::count(text.begin(), text.end(), '\n'));
}

INSTANTIATE_TEST_SUITE_P(Families, Edits, ::testing::ValuesIn(kFamilies),
                         [](const auto& each) { return std::string(each.param.name); });

TEST_P(Edits, ADryRunShowsWhatTheEditDoesAndChangesNothing) {
  // Lines that resemble the deleted ones, a piece of a long line that is one, and text around them.
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

// As the editors do: these begin a word, or end it.
TEST_P(Edits, ADryRunKnowsWhatEndsAWord) {
  const bool is_services = family.deletion[0] == "domain";
  const std::string line = is_services ? "domain 53/tcp\n" : "l0:0:off:/x\n";
  const auto removed = [&](const std::string& contents) {
    writeFile(file, contents);
    const Result shown = edit(family, "delete", file, {"--dry-run"});
    EXPECT_EQ(shown.status, 0) << shown.err;
    EXPECT_EQ(edit(family, "delete", file).status, 0);
    const std::string rest = contentsOf(file);
    EXPECT_EQ(shown.out.find("\n+", shown.out.find("@@")), std::string::npos) << shown.out;
    size_t lines = 0;
    for (size_t at = shown.out.find("@@"); (at = shown.out.find("\n-", at)) != std::string::npos;
         ++at) {
      ++lines;
    }
    EXPECT_EQ(lines, linesIn(contents) - linesIn(rest)) << shown.out;
    return lines;
  };
  for (const char blank : {' ', '\t', '\v', '\f', '\r'}) {
    SCOPED_TRACE(static_cast<int>(blank));
    EXPECT_EQ(removed(line + "a\n" + blank + line), 2U);
    EXPECT_EQ(removed(line + (is_services ? "domain" : "l0") + blank + "\n"),
              is_services ? 2U : 1U);
  }
  EXPECT_EQ(removed(line + line.substr(0, line.find_first_of(" :")) + '\0' + "x\n"), 2U);
  EXPECT_EQ(removed(line + "x" + line + "domain1 1/tcp\nl01:2:off:\n"), 1U);
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

TEST_P(Edits, ADryRunOfRestoreFailsWhereItWould) {
  const std::string copy = temp.file("copy", "# another\n");
  const std::string missing = temp.path("missing/" + std::string(family.name));
  for (const std::string& unwritable : {missing, std::string()}) {
    for (const char* const option : {"--dry-run", "--yes"}) {
      EXPECT_EQ(osutils({family.name, "restore", option, "--no-lock", "--file", unwritable,
                         "--backup", copy})
                    .status,
                3);
    }
  }
  EXPECT_EQ(contentsOf(copy), "# another\n");
}

TEST_P(Edits, ADryRunNeedsNoLock) {
  const LockHolder holder(lock);
  EXPECT_EQ(edit(family, "add", file, {"--dry-run"}).err, "");
}

}  // namespace
