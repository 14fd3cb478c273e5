// The commands of the family "inittab".
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "tool.h"
#include "tool_edits.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::HasSubstr;

class Inittab : public Tool {
 protected:
  // Runs `osutils inittab COMMAND…` on the test's own file.
  Result inittab(
      Arguments arguments, const std::function<void()>& prepare = [] {}) const {
    arguments.insert(arguments.begin(), "inittab");
    arguments.insert(arguments.begin() + 2, {"--file", table});
    return osutils(std::move(arguments), prepare);
  }

  const std::string table = temp.file("inittab", kInittab);
};

std::string entry(const std::string& id, const std::string& runlevels, const std::string& action,
                  const std::string& process) {
  return R"({"id":")" + id + R"(","runlevels":")" + runlevels + R"(","action":")" + action +
         R"(","process":")" + process + "\"}";
}

TEST_F(Inittab, ListsTheEntriesInTheOrderOfTheFile) {
  expectAnswer(inittab({"list"}),
               "ID    RUNLEVELS  ACTION       PROCESS\n"
               "id    2          initdefault  \n"
               "l0    0          wait         /etc/init.d/rc 0\n"
               "vra0  2345       respawn      /opt/a:b --x\n"
               "l0    6          wait         /etc/init.d/rc 6\n");
  expectAnswer(inittab({"list", "--json"}), "[" + entry("id", "2", "initdefault", "") + "," +
                                                entry("l0", "0", "wait", "/etc/init.d/rc 0") + "," +
                                                entry("vra0", "2345", "respawn", "/opt/a:b --x") +
                                                "," + entry("l0", "6", "wait", "/etc/init.d/rc 6") +
                                                "]\n");
}

TEST_F(Inittab, ListsNothingOfAFileWithoutEntries) {
  for (const char* contents : {"", "\n", "#id:2:wait:x\n", ":id\n"}) {
    SCOPED_TRACE(contents);
    writeFile(table, contents);
    expectAnswer(inittab({"list"}), "");
    expectAnswer(inittab({"list", "--json"}), "[]\n");
  }
}

TEST_F(Inittab, ListShowsAFieldThatFillsItsPlace) {
  writeFile(table, "0123456789:abcdefghij:" + std::string(30, 'z') + ":" + std::string(300, 'p'));
  expectAnswer(
      inittab({"list", "--json"}),
      "[" + entry("0123456789", "abcdefghij", std::string(30, 'z'), std::string(256, 'p')) + "]\n");
}

TEST_F(Inittab, AddAppendsTheLineAndShowsIt) {
  expectAnswer(inittab({"add", "vra1", "2345", "respawn", "/x y:z"}),
               "ID    RUNLEVELS  ACTION   PROCESS\nvra1  2345       respawn  /x y:z\n");
  const std::string nine(9, '9');
  const std::string action(29, 'a');
  const std::string process(256, 'p');
  expectAnswer(inittab({"add", "--json", "--force", nine, nine, action, process}),
               entry(nine, nine, action, process) + "\n");
  expectAnswer(inittab({"add", "--json", "--force", "e", "", "", ""}),
               entry("e", "", "", "") + "\n");
  EXPECT_EQ(contentsOf(table), std::string(kInittab) + "vra1:2345:respawn:/x y:z\n" + nine + ":" +
                                   nine + ":" + action + ":" + process + "\ne:::\n");
}

TEST_F(Inittab, DeleteRemovesEveryLineOfTheIdAndLeavesNoBackup) {
  expectAnswer(inittab({"delete", "l0"}), "DELETED\nl0\n");
  expectAnswer(inittab({"delete", "--json", "id"}), "{\"deleted\":\"id\"}\n");
  EXPECT_EQ(contentsOf(table), "# inittab of the test\nvra0:2345:respawn:/opt/a:b --x\n");
  EXPECT_FALSE(pathExists(table + ".vrasave"));
}

TEST_F(Inittab, DeleteKeepsItsCopyAtTheBackupPath) {
  const std::string blocked =
      temp.dir("inittab.vrasave");  // makes the default backup path unusable
  const std::string copy = temp.path("copy");
  expectFailure(inittab({"delete", "id"}),
                "osutils: inittab delete: unwilling to perform (53): the backup path " + blocked +
                    " is a directory\n");
  expectAnswer(inittab({"delete", "--backup", copy, "id"}), "DELETED\nid\n");
  EXPECT_FALSE(pathExists(copy));
  EXPECT_TRUE(pathExists(blocked));
}

TEST_F(Inittab, FindsTheFirstEntryByAnyPartOfItsCommand) {
  expectAnswer(inittab({"find", "/rc"}),
               "ID  RUNLEVELS  ACTION  PROCESS\nl0  0          wait    /etc/init.d/rc 0\n");
  expectAnswer(inittab({"find", "--json", "rc 6"}),
               entry("l0", "6", "wait", "/etc/init.d/rc 6") + "\n");
  expectAnswer(inittab({"find", "--json", ""}), entry("id", "2", "initdefault", "") + "\n");
  expectFailure(inittab({"find", "respawn"}),
                "osutils: inittab find: no such object (32): " + table +
                    " has no entry whose command contains \"respawn\"\n");
}

TEST_F(Inittab, FindsAFreeId) {
  expectAnswer(inittab({"free-id"}), "ID\nvra1\n");
  writeFile(table, "");
  expectAnswer(inittab({"free-id", "--json"}), "{\"id\":\"vra0\"}\n");
  std::string all;
  for (const char c : std::string("0123456789abcdefghijklmnopqrstuvwxyz")) {
    all += std::string("vra") + c + ":2:off:\n";
  }
  writeFile(table, all);
  expectFailure(inittab({"free-id"}),
                "osutils: inittab free-id: unavailable (52): all ids that begin with vra are taken "
                "in " +
                    table + "\n");
}

TEST_F(Inittab, EveryCommandReportsAFileThatCannotBeLoaded) {
  const std::string fifo = temp.path("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  const std::string missing = temp.path("missing");
  const std::pair<std::string, std::string> cases[] = {
      {missing, "no such object (32): cannot read " + missing},
      {"", "no such object (32): cannot read "},
      {temp.path(), "constraint violation (19): cannot read " + temp.path()},
      {fifo, "unwilling to perform (53): " + fifo + " is not a regular file"},
  };
  const std::vector<Arguments> commands = {
      {"list"}, {"add", "a", "2", "wait", "x"}, {"delete", "id"}, {"find", "x"}, {"free-id"}};
  for (const auto& [path, result] : cases) {
    for (Arguments command : commands) {
      SCOPED_TRACE(path + " " + command[0]);
      const std::string line = "osutils: inittab " + command[0] + ": " + result + "\n";
      command.insert(command.begin(), "inittab");
      command.insert(command.begin() + 2, {"--json", "--file", path});
      expectFailure(osutils(command), line);
    }
  }
  EXPECT_FALSE(pathExists(missing));
}

TEST_F(Inittab, ReportsWhatTheEditorRefuses) {
  expectFailure(inittab({"add", "l0", "2", "wait", "x"}),
                "osutils: inittab add: already exists (68): " + table + " has an entry \"l0\"\n");
  for (const std::string id : {"L0", "", "l0:0"}) {
    expectFailure(inittab({"delete", id}), "osutils: inittab delete: no such object (32): " +
                                               table + " has no entry \"" + id + "\"\n");
  }
  EXPECT_EQ(contentsOf(table), kInittab);
}

TEST_F(Inittab, AddRefusesWhatCouldNotBeReadBack) {
  const std::string add = "osutils: inittab add: parameter error (89): ";
  for (const std::string id : {"", "#a", " a", "_", "\303\244", "/", "@", "[", "`", "{"}) {
    SCOPED_TRACE(id);
    expectFailure(inittab({"add", id, "2", "wait", "x"}),
                  add + "ID must begin with a letter or a digit: \"" + id + "\"\n");
  }
  const std::string fields[] = {"ID", "RUNLEVELS", "ACTION", "PROCESS"};
  const size_t most[] = {9, 9, 29, 256};
  for (size_t i = 0; i < 4; ++i) {
    for (const std::string& text :
         {std::string(most[i] + 1, 'a'), std::string("a\nb"), std::string("a\033"),
          std::string("a\177"), std::string("a:b")}) {
      if (i == 3 && text == "a:b") continue;
      SCOPED_TRACE(fields[i] + text);
      Arguments arguments = {"add", "a", "2", "wait", "x"};
      arguments[i + 1] = text;
      std::string shown = text;
      std::replace_if(
          shown.begin(), shown.end(), [](char c) { return (c >= 0 && c < ' ') || c == 127; }, '?');
      expectFailure(inittab(arguments), add + fields[i] + " must have at most " +
                                            std::to_string(most[i]) + " characters, " +
                                            (i == 3 ? "" : "no colons and ") +
                                            "no control characters: \"" + shown + "\"\n");
    }
  }
  EXPECT_EQ(contentsOf(table), kInittab);
}

TEST_F(Inittab, AddTakesEveryLetterAndDigit) {
  std::string expected = kInittab;
  for (const std::string id : {"0", "9", "a", "z", "A", "Z"}) {
    expectAnswer(inittab({"add", "--json", id, "2", "wait", "x"}),
                 entry(id, "2", "wait", "x") + "\n");
    expected += id + ":2:wait:x\n";
  }
  EXPECT_EQ(contentsOf(table), expected);
}

TEST_F(Inittab, AddRefusesAFileWhoseLastLineIsIncomplete) {
  writeFile(table, "id:2:wait:x");
  expectFailure(inittab({"add", "a", "2", "wait", "x"}),
                "osutils: inittab add: unwilling to perform (53): the last line of " + table +
                    " has no newline: the new one would join it\n");
  EXPECT_EQ(contentsOf(table), "id:2:wait:x");
}

TEST_F(Inittab, ReportsADeletionThatRemovedNoLine) {
  // An id that fills its array reads on in the record, but not in the line.
  const std::string contents = "abcdefghij:2:wait:/x\n";
  writeFile(table, contents);
  expectFailure(inittab({"delete", "abcdefghij2"}),
                "osutils: inittab delete: unwilling to perform (53): no line of " + table +
                    " has the exact id \"abcdefghij2\"\n");
  EXPECT_EQ(contentsOf(table), contents);
}

TEST_F(Inittab, ReportsADeletionAfterWhichAnotherLineReadsAsTheId) {
  // An id that fills its array reads on in the runlevels.
  const std::string other = "abcdefghij:2:wait:/x\n";
  writeFile(table, other + "abcdefghij2:3:wait:/y\n");
  expectFailure(inittab({"delete", "abcdefghij2"}),
                "osutils: inittab delete: operations error (1): " + table +
                    " still has an entry \"abcdefghij2\"\n");
  EXPECT_EQ(contentsOf(table), other);
}

TEST_F(Inittab, WorksOnTheSystemsFileByDefault) {
  REQUIRE_ROOT("to put another file in the place of /etc/inittab");
  EXPECT_EQ(withPrivateEtc([] {
              writeFile("/etc/inittab", kInittab);
              EXPECT_EQ(osutils({"inittab", "add", "a", "2", "wait", "x"}).status, 0);
              EXPECT_EQ(contentsOf("/etc/inittab"), std::string(kInittab) + "a:2:wait:x\n");
              expectAnswer(osutils({"inittab", "delete", "a"}), "DELETED\na\n");
              EXPECT_EQ(contentsOf("/etc/inittab"), kInittab);
              EXPECT_FALSE(pathExists("/etc/inittab.vrasave"));
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
    EXPECT_THAT(result.err, HasSubstr("ACTION is unknown to init"));
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

}  // namespace
