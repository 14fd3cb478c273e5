#include <errno.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <spawn.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <random>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr std::string_view kMetaCharacters = "&;`'\"|*?~<>^()[]{}$\n\r\\";
static_assert(kMetaCharacters.size() == 22);

bool isMeta(char c) { return kMetaCharacters.find(c) != std::string_view::npos; }

using Words = std::vector<std::string>;

// Every byte except NUL.
std::vector<char> allBytes() {
  std::vector<char> bytes;
  for (int byte = 1; byte < 256; ++byte) bytes.push_back(static_cast<char>(byte));
  return bytes;
}

// ---- checkForMetaChars ----

TEST(MetaCharacters, AreTheseTwentyTwoBytesAndNoOther) {
  for (const char c : allBytes()) {
    SCOPED_TRACE(static_cast<unsigned char>(c));
    char alone[] = {c, '\0'};
    EXPECT_EQ(checkForMetaChars(alone), isMeta(c));
  }
}

TEST(MetaCharacters, AreFoundWhereverTheyStand) {
  for (const char c : kMetaCharacters) {
    for (std::string text : {"xab cd", "ab xcd", "ab cdx"}) {
      EXPECT_FALSE(checkForMetaChars(text.data()));
      text[text.find('x')] = c;
      SCOPED_TRACE(text);
      EXPECT_TRUE(checkForMetaChars(text.data()));
    }
  }
  std::string far(100'000, 'a');
  EXPECT_FALSE(checkForMetaChars(far.data()));
  far.back() = '\\';
  EXPECT_TRUE(checkForMetaChars(far.data()));
}

TEST(MetaCharacters, AfterTheEndDoNotCount) {
  char text[] = "ab\0$";
  EXPECT_FALSE(checkForMetaChars(text));
}

TEST(MetaCharacters, AreNotInNullInNothingAndInBlanks) {
  EXPECT_FALSE(checkForMetaChars(nullptr));
  for (std::string text : {"", " ", "a b", "\t", "hey!", "#", "-rf", "a=b", "/usr/lib", "%,:@+"}) {
    SCOPED_TRACE(text);
    EXPECT_FALSE(checkForMetaChars(text.data()));
  }
  std::string line_feed = "a\nb";
  EXPECT_TRUE(checkForMetaChars(line_feed.data()));
}

// ---- checkOptionsForMetaChars ----

bool screened(int count, std::vector<const char*> arguments) {
  return checkOptionsForMetaChars(count, const_cast<char**>(arguments.data()));
}

TEST(Options, AreScreenedFromTheFirstToTheLastByCount) {
  EXPECT_FALSE(screened(3, {"prog", "one", "two", "three", nullptr}));
  EXPECT_TRUE(screened(3, {"prog", "o|ne", "two", "three", nullptr}));
  EXPECT_TRUE(screened(3, {"prog", "one", "t|wo", "three", nullptr}));
  EXPECT_TRUE(screened(3, {"prog", "one", "two", "thr|ee", nullptr})) << "the one at the count";
  EXPECT_FALSE(screened(2, {"prog", "one", "two", "thr|ee", nullptr})) << "beyond the count";
  EXPECT_TRUE(screened(1, {"p", "a|b"}));
}

TEST(Options, DoNotIncludeTheProgramsName) {
  EXPECT_FALSE(screened(2, {";", "ok", nullptr}));
  EXPECT_FALSE(screened(1, {"$prog", "", nullptr}));
}

TEST(Options, EndAtANullEntry) {
  EXPECT_FALSE(screened(3, {"prog", "one", nullptr, "thr|ee"}));
  EXPECT_FALSE(screened(2, {"prog", nullptr, "t|wo"}));
  EXPECT_TRUE(screened(2, {nullptr, "one", "t|wo"})) << "a missing name of the program is no end";
}

TEST(Options, AreNoneWithoutAPositiveCountAndAVector) {
  for (const int count : {0, -1, INT_MIN}) EXPECT_FALSE(screened(count, {"prog", "o|ne"})) << count;
  EXPECT_FALSE(checkOptionsForMetaChars(1, nullptr));
  EXPECT_FALSE(checkOptionsForMetaChars(INT_MAX, nullptr));
}

TEST(Options, AreFoundToHoldEachOfTheMetaCharacters) {
  for (const char c : allBytes()) {
    const char argument[] = {'a', c, '\0'};
    EXPECT_EQ(screened(1, {"prog", argument, nullptr}), isMeta(c)) << testing::PrintToString(c);
  }
}

TEST(Screening, LeavesNoTrace) {
  const Records records;
  char text[] = "a|b";
  EXPECT_TRUE(checkForMetaChars(text));
  EXPECT_FALSE(checkForMetaChars(nullptr));
  EXPECT_TRUE(screened(1, {"prog", text}));
  EXPECT_FALSE(checkOptionsForMetaChars(0, nullptr));
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

// ---- Refused without a shell ----

TEST(Screening, MakesIsValidUserRefuseEachMetaCharacterBeforeAnyLookUp) {
  for (const char c : kMetaCharacters) {
    const std::string piece(1, c);
    for (const std::string& user : {piece, piece + "root", "ro" + piece + "ot", "root" + piece}) {
      SCOPED_TRACE(testing::PrintToString(user));
      const Records records;
      const FakeSystem shell;
      const FailingCall users(Call::getpwnam, 0, kNever);
      const FailingCall own_user(Call::getpwuid, 0, kNever);
      const FailingCall prints(Call::vra_asprintf, 0, kNever);

      EXPECT_EQ(isValidUser(user.c_str(), "extra"), 89);

      EXPECT_EQ(users.calls() + own_user.calls() + prints.calls(), 0);
      EXPECT_THAT(shell.commands(), IsEmpty());
      EXPECT_THAT(records.trail(),
                  ElementsAre("> isValidUser", "D isValidUser: passed in meta characters.\n",
                              "<! isValidUser 89"));
    }
  }
}

TEST(Screening, MakesDeleteDirForcefullyRefuseEachMetaCharacterAlthoughTheDirectoryExists) {
  const TempDir temp;
  for (const char c : kMetaCharacters) {
    std::string path = temp.dir(std::string("a") + c + "b");
    SCOPED_TRACE(testing::PrintToString(path));
    const Records records;
    const FakeSystem shell;
    const FailingCall queries(Call::stat64, 0, kNever);

    EXPECT_FALSE(deleteDirForcefully(path.data()));

    EXPECT_EQ(queries.calls(), 0);
    EXPECT_THAT(shell.commands(), IsEmpty());
    EXPECT_TRUE(pathExists(path));
    EXPECT_THAT(records.trail(), ElementsAre("> deleteDirForcefully",
                                             "D deleteDirForcefully: passed in a metacharacter.\n",
                                             "< deleteDirForcefully 0"));
  }
}

// ---- How a shell parses the text that passes ----

// How a shell parsed a command: the words of each call of its program, the output on descriptors 1
// and 2, to which the program writes "o" and "e", and the exit status.
struct Parsed {
  std::vector<Words> calls;
  std::string out;
  std::string err;
  std::string status;
  bool operator==(const Parsed&) const = default;
};

void PrintTo(const Parsed& parsed, std::ostream* out) {
  *out << testing::PrintToString(parsed.calls) << " out " << testing::PrintToString(parsed.out)
       << " err " << testing::PrintToString(parsed.err) << " status " << parsed.status;
}

// The NUL-terminated strings in the file.
Words piecesOf(const std::string& path) {
  const std::string contents = contentsOf(path);
  Words pieces;
  for (size_t begin = 0, end = 0; (end = contents.find('\0', begin)) != std::string::npos;
       begin = end + 1) {
    pieces.push_back(contents.substr(begin, end - begin));
  }
  return pieces;
}

// Runs the script in a shell that finds no program, in `directory`, with descriptors 1 to 3 open to
// `files`. Returns the wait status.
int runShell(const std::string& script, std::span<const std::string> arguments,
             const std::string& locale, const std::string& directory,
             const std::string (&files)[3]) {
  Words words = {"sh", "-c", script, "sh"};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv;
  for (std::string& word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  std::string path = "PATH=/nonexistent";
  std::string home = "HOME=/nonexistent";
  std::string language = "LC_ALL=" + locale;
  char* const environment[] = {path.data(), home.data(), language.data(), nullptr};

  posix_spawn_file_actions_t actions;
  EXPECT_EQ(posix_spawn_file_actions_init(&actions), 0);
  EXPECT_EQ(posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0), 0);
  for (int descriptor = 1; descriptor <= 3; ++descriptor) {
    EXPECT_EQ(posix_spawn_file_actions_addopen(&actions, descriptor, files[descriptor - 1].c_str(),
                                               O_WRONLY | O_CREAT | O_APPEND, 0600),
              0);
  }
  EXPECT_EQ(posix_spawn_file_actions_addchdir_np(&actions, directory.c_str()), 0);
  pid_t child = 0;
  const int error = posix_spawn(&child, "/bin/sh", &actions, nullptr, argv.data(), environment);
  posix_spawn_file_actions_destroy(&actions);
  EXPECT_EQ(error, 0) << strerror(error);
  int status = -1;
  if (error == 0) {
    while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
    }
  }
  return status;
}

// Lets a real shell run each command, which begins with `program`. A shell function replaces the
// program.
std::vector<Parsed> parsedByAShell(const std::string& program,
                                   std::span<const std::string> commands,
                                   const std::string& locale = "C") {
  const std::string script =
      "called() { printf '%s\\0' call $# \"$@\" >&3; printf o; printf e >&2; }\n"
      "for command; do\n"
      "  eval \"called${command#" +
      program +
      "}\"\n"
      "  printf '%s\\0' end $? >&3\n"
      "  printf '\\0'; printf '\\0' >&2\n"
      "done\n";
  const TempDir temp;
  const std::string empty = temp.dir("empty");
  const std::string files[] = {temp.path("out"), temp.path("err"), temp.path("words")};
  EXPECT_EQ(runShell(script, commands, locale, empty, files), 0) << contentsOf(files[1]);
  EXPECT_TRUE(std::filesystem::is_empty(empty)) << "a command made a file";

  const Words out = piecesOf(files[0]);
  const Words err = piecesOf(files[1]);
  const Words said = piecesOf(files[2]);
  std::vector<Parsed> all;
  size_t at = 0;
  while (at + 1 < said.size() && all.size() < std::min(out.size(), err.size())) {
    Parsed parsed{{}, out[all.size()], err[all.size()], ""};
    while (at + 1 < said.size() && said[at] == "call") {
      const size_t first = at + 2;
      at = std::min(first + std::stoul(said[at + 1]), said.size());
      parsed.calls.emplace_back(said.begin() + static_cast<ptrdiff_t>(first),
                                said.begin() + static_cast<ptrdiff_t>(at));
    }
    if (at + 1 >= said.size() || said[at] != "end") break;
    parsed.status = said[at + 1];
    at += 2;
    all.push_back(parsed);
  }
  EXPECT_EQ(at, said.size());
  EXPECT_EQ(all.size(), commands.size()) << "the shell gave up";
  return all;
}

Parsed parsedByAShell(const std::string& program, const std::string& command) {
  const std::vector<Parsed> all = parsedByAShell(program, std::span(&command, 1));
  return all.size() == 1 ? all[0] : Parsed{};
}

// One call with these words; aSilentCall discards its output.
Parsed aCall(const Words& words) { return {{words}, "o", "e", "0"}; }
Parsed aSilentCall(const Words& words) { return {{words}, "", "", "0"}; }

// Splits the text at blanks and tabs only.
Words wordsOf(const std::string& text) {
  Words words;
  size_t end = 0;
  for (size_t begin = 0; (begin = text.find_first_not_of(" \t", end)) != std::string::npos;) {
    end = std::min(text.find_first_of(" \t", begin), text.size());
    words.push_back(text.substr(begin, end - begin));
  }
  return words;
}

Words operator+(Words first, const Words& second) {
  first.insert(first.end(), second.begin(), second.end());
  return first;
}

bool hasComment(const std::string& text) {
  return std::ranges::any_of(wordsOf(text), [](const std::string& word) { return word[0] == '#'; });
}

// Random texts that pass the screening, the same in every run. Without "/", because each text names
// one directory.
class RandomTexts {
 public:
  RandomTexts() {
    for (const char c : allBytes()) {
      if (!isMeta(c) && c != '/') plain_.push_back(std::string(1, c));
    }
  }

  std::string next() {
    std::string text;
    for (size_t left = 1 + below(24); left > 0; --left) {
      const Words& from = below(2) == 0 ? plain_ : special_;
      text += from[below(from.size())];
    }
    return text;
  }

 private:
  size_t below(size_t limit) { return engine_() % limit; }

  std::mt19937 engine_{20060501};
  Words plain_;
  // What a shell might not take literally, perhaps only in some locale.
  const Words special_ = {
      " ",
      "\t",
      "  ",
      " #",
      "#",
      "!",
      "!!",
      " ! ",
      "=",
      "a=b",
      " a=b ",
      "-",
      " -",
      "--",
      "%",
      "%1",
      ":",
      ",",
      "@",
      "+",
      ".",
      "..",
      " 0",
      "1",
      "2",
      " if ",
      " do ",
      " in ",
      "fi",
      "a",
      "B",
      "\x01",
      "\x02",
      "\b",
      "\v",
      "\f",
      "\x1b",
      "\x7f",
      "\x80",
      "\x81",
      "\x82",
      "\x83",
      "\x84",
      "\x85",
      "\x86",
      "\x87",
      "\x88",
      "\x9b",
      "\xa0",
      "\xff",
      "\xc2\xa0",
      "\xc3\xa4",
      "\xe2\x80\xa8",
      "\xe3\x80\x80",
      "\xf0\x9f\x98\x80",
  };
};

constexpr int kManyTexts = 4000;

// Takes the commands that the library builds from thousands of texts, which `command_of` returns,
// and expects that a shell parses each of them as `expected_of` says.
void expectLiteral(const std::string& program,
                   const std::function<std::string(const std::string&)>& command_of,
                   const std::function<Parsed(const std::string&)>& expected_of) {
  RandomTexts random;
  Words texts;
  Words commands;
  while (texts.size() < kManyTexts) {
    std::string text = random.next();
    if (hasComment(text)) continue;
    ASSERT_FALSE(checkForMetaChars(text.data())) << testing::PrintToString(text);
    texts.push_back(text);
    commands.push_back(command_of(text));
    ASSERT_TRUE(commands.back().starts_with(program + " ")) << testing::PrintToString(text);
  }

  constexpr size_t kBatch = 1000;
  for (const char* const locale : {"C", "C.UTF-8"}) {
    for (size_t first = 0; first < texts.size(); first += kBatch) {
      const auto batch = std::span(commands).subspan(first, kBatch);
      const std::vector<Parsed> parsed = parsedByAShell(program, batch, locale);
      ASSERT_EQ(parsed.size(), batch.size()) << locale;
      for (size_t i = 0; i < batch.size(); ++i) {
        ASSERT_EQ(parsed[i], expected_of(texts[first + i]))
            << locale << ": " << testing::PrintToString(batch[i]);
      }
    }
  }
}

// Returns the one command that `call` passes to the shell.
std::string theCommandOf(const std::function<void()>& call) {
  const FakeSystem shell;
  call();
  EXPECT_EQ(shell.commands().size(), 1U);
  return shell.commands().size() == 1 ? shell.commands()[0].value_or("") : "";
}

std::string commandOfDeleting(std::string path) {
  return theCommandOf([&] { EXPECT_TRUE(deleteDirForcefully(path.data())); });
}

// Works for any name: a user exists for the library when the mutex of the look-up cannot be locked.
std::string commandOfTryingOut(const std::string& user) {
  return theCommandOf([&] {
    const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
    EXPECT_EQ(isValidUser(user.c_str(), nullptr), 0);
    EXPECT_TRUE(lock.fired());
  });
}

// Changes the current directory until the end of the scope.
class WorkingDirectory {
 public:
  explicit WorkingDirectory(const std::string& path) : before_(std::filesystem::current_path()) {
    std::filesystem::current_path(path);
  }
  ~WorkingDirectory() {
    std::error_code ignored;
    std::filesystem::current_path(before_, ignored);
  }
  WorkingDirectory(const WorkingDirectory&) = delete;
  WorkingDirectory& operator=(const WorkingDirectory&) = delete;

 private:
  const std::filesystem::path before_;
};

#define REQUIRE_TO_BE_ROOT() REQUIRE_ROOT("because only root's isValidUser runs a command")

// Runs the body in an empty directory, as root in memory: some disks are slow with thousands of
// directories.
void inAnEmptyDirectory(const std::function<void()>& body) {
  const TempDir temp;
  const auto run = [&] {
    const WorkingDirectory here(temp.path());
    body();
    return 0;
  };
  if (geteuid() != 0) {
    run();
    return;
  }
  EXPECT_EQ(withPrivateMounts([&] {
              EXPECT_EQ(mount("osutils-test", temp.path().c_str(), "tmpfs", 0, "mode=0755"), 0);
              return run();
            }),
            0);
}

TEST(ShellSafety, OfEveryTextThatDeleteDirForcefullyAccepts) {
  inAnEmptyDirectory([] {  // paths are relative, so that the text begins a word
    expectLiteral(
        "rm",
        [](const std::string& text) {
          const bool made = mkdir(text.c_str(), 0700) == 0;
          EXPECT_TRUE(made || errno == EEXIST) << testing::PrintToString(text);
          const std::string command = commandOfDeleting(text);
          EXPECT_TRUE(!made || rmdir(text.c_str()) == 0);
          return command;
        },
        [](const std::string& text) { return aCall(Words{"-rf"} + wordsOf(text)); });
  });
}

TEST(ShellSafety, OfEveryNameThatIsValidUserAccepts) {
  REQUIRE_TO_BE_ROOT();
  expectLiteral("/bin/su", commandOfTryingOut, [](const std::string& text) {
    return aSilentCall(wordsOf(text) + Words{"-c", "exit 0"});
  });
}

TEST(ShellSafety, IsSomethingThatTheTestsCanTellFromItsAbsence) {
  EXPECT_EQ(parsedByAShell("rm", "rm -rf a b"), aCall({"-rf", "a", "b"}));
  for (const std::string text : {"a;b", "a$b", "a\\b", "'a'", "\"a\"", "a|b", "a\nb", "b~ ~", "`a`",
                                 "a;called b", "a >/dev/null", "a 2>/dev/null", "a </dev/null"}) {
    SCOPED_TRACE(text);
    EXPECT_NE(parsedByAShell("rm", "rm -rf " + text), aCall(Words{"-rf"} + wordsOf(text)));
  }
}

TEST(ShellSafety, EndsAtAWordThatBeginsWithANumberSign) {
  const TempDir temp;
  const WorkingDirectory here(temp.path());
  for (const std::string path : {"#all", "#all of it", "a #b c", "a\t#b", "a #", "a#b #"}) {
    SCOPED_TRACE(path);
    temp.dir(path);
    const std::string read = path.starts_with('#') ? "" : path.substr(0, path.find_last_of("#"));
    EXPECT_EQ(parsedByAShell("rm", commandOfDeleting(path)), aCall(Words{"-rf"} + wordsOf(read)));
  }
}

TEST(ShellSafety, OfAUsersNameEndsThereTooAndTakesTheRestOfTheCommandAlong) {
  REQUIRE_TO_BE_ROOT();
  EXPECT_EQ(parsedByAShell("/bin/su", commandOfTryingOut("ann #b")), aCall({"ann"}));
  EXPECT_EQ(parsedByAShell("/bin/su", commandOfTryingOut("#ann")), aCall({}));
  EXPECT_EQ(parsedByAShell("/bin/su", commandOfTryingOut("ann#b")),
            aSilentCall({"ann#b", "-c", "exit 0"}));
}

TEST(ShellSafety, LetsBlanksAndTabsMakeSeveralWords) {
  const TempDir temp;
  const WorkingDirectory here(temp.path());
  for (const std::string path : {"a b", "a\tb", " \ta  b\t ", " "}) {
    SCOPED_TRACE(path);
    temp.dir(path);
    const Words words = path == " " ? Words{"-rf"} : Words{"-rf", "a", "b"};
    EXPECT_EQ(parsedByAShell("rm", commandOfDeleting(path)), aCall(words));
  }
}

TEST(ShellSafety, LetsBlanksAndTabsMakeSeveralWordsOfAUsersName) {
  REQUIRE_TO_BE_ROOT();
  for (const std::string user : {"a b", "a\tb", " a \t b "}) {
    SCOPED_TRACE(user);
    EXPECT_EQ(parsedByAShell("/bin/su", commandOfTryingOut(user)),
              aSilentCall({"a", "b", "-c", "exit 0"}));
  }
}

TEST(ShellSafety, HoldsForTheShellAndTheProgramThatTheLibraryRuns) {
  const TempDir temp;
  const WorkingDirectory here(temp.path());
  const std::string kept = temp.dir("kept");
  RandomTexts random;
  for (int done = 0; done < 50;) {
    std::string name = random.next();
    // Only names that rm takes as one path.
    if (wordsOf(name) != Words{name} || hasComment(name) || name[0] == '-' ||
        !std::filesystem::create_directory(name)) {
      continue;
    }
    SCOPED_TRACE(testing::PrintToString(name));
    writeFile(name + "/file", "text");
    EXPECT_TRUE(deleteDirForcefully(name.data()));
    EXPECT_FALSE(pathExists(name));
    ++done;
  }
  EXPECT_TRUE(pathExists(kept));
}

}  // namespace
