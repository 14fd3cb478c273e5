// The screening of texts for a shell. What passes it is put into a command by the library, and dash
// and bash run that command: its words must arrive as they are, and nothing else may happen.
#include <dlfcn.h>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz.h"
#include "input.h"
#include "osutils.h"

namespace {

using Words = std::vector<std::string>;

constexpr size_t kLongest = 1000;  // one write to a pipe must hold it

// ---- What is required ----

bool isMeta(char c) {
  switch (c) {
    case '&':
    case ';':
    case '`':
    case '\'':
    case '"':
    case '|':
    case '*':
    case '?':
    case '~':
    case '<':
    case '>':
    case '^':
    case '(':
    case ')':
    case '[':
    case ']':
    case '{':
    case '}':
    case '$':
    case '\n':
    case '\r':
    case '\\':
      return true;
    default:
      return false;
  }
}

bool passes(const std::string& text) { return std::none_of(text.begin(), text.end(), isMeta); }

// Appends the words of a text that passes. Returns false if the rest of the line is a comment.
bool appendWords(Words& words, const std::string& text) {
  bool is_in_word = false;
  for (const char c : text) {
    if (c == ' ' || c == '\t') {
      is_in_word = false;
    } else if (is_in_word) {
      words.back() += c;
    } else {
      if (c == '#') return false;
      words.emplace_back(1, c);
      is_in_word = true;
    }
  }
  return true;
}

bool endsInWord(const std::string& text) {
  return !text.empty() && text.back() != ' ' && text.back() != '\t';
}

// ---- The shells ----

// The command that the library gave to system().
std::optional<std::string> command_of_library;
bool is_library_called = false;

void makePipe(int (&ends)[2]) {
  if (pipe2(ends, O_CLOEXEC) != 0) giveUp("pipe2");
}

// A shell that runs commands line by line. Its functions answer with the words that they get, each
// ended by a NUL.
class Shell {
 public:
  Shell(Words command, const char* locale, const Folder& folder)
      : name_(command[0] + " with " + locale), folder_(folder) {
    int input[2], answers[2], other[2];
    makePipe(input);
    makePipe(answers);
    makePipe(other);
    posix_spawn_file_actions_t files;
    posix_spawn_file_actions_init(&files);
    // Above the numbers that they become, so that none closes another one.
    const int from[] = {input[0], other[1], other[1], answers[1]};
    for (int to = 0; to < 4; ++to) {
      const int high = fcntl(from[to], F_DUPFD_CLOEXEC, 10);
      posix_spawn_file_actions_adddup2(&files, high, to);
    }
    posix_spawn_file_actions_addchdir_np(&files, folder.path("").c_str());
    std::vector<char*> arguments;
    for (std::string& word : command) arguments.push_back(word.data());
    arguments.push_back(nullptr);
    std::string setting = std::string("LC_ALL=") + locale;
    std::string path = "PATH=/nonexistent", home = "HOME=/home/of/user";
    char* const environment[] = {setting.data(), path.data(), home.data(), nullptr};
    pid_t process = 0;
    if (posix_spawn(&process, arguments[0], &files, nullptr, arguments.data(), environment) != 0)
      giveUp(name_);
    posix_spawn_file_actions_destroy(&files);
    close(input[0]);
    close(answers[1]);
    close(other[1]);
    commands_ = input[1];
    answers_ = answers[0];
    other_ = other[0];
    // In one write, because the parts of a pipeline answer at the same time.
    for (const std::string function : {"words", "ps", "grep"}) {
      (void)run(function + "() { set -- " + function +
                " \"$#\" \"$@\"; printf '%s\\0' \"$@\" >&3; }");
    }
  }

  // Runs a command and returns its status, and each call of a function with its words.
  std::vector<Words> run(const std::string& command) {
    send(command + "\nprintf 'status\\0001\\0%s\\0$\\0' $? >&3\n");
    const std::string kEnd("\0$\0", 3);  // no word of a text that passes
    std::string answer;
    while (!answer.ends_with(kEnd)) answer += receive(command);
    pollfd other{other_, POLLIN, 0};
    if (poll(&other, 1, 0) != 0)
      fail("the shell printed", name_ + ": " + shown(command), "nothing");
    if (!std::filesystem::is_empty(folder_.path("")))
      fail("the shell made a file", name_ + ": " + shown(command), "none");
    std::vector<Words> calls;
    for (size_t at = 0; at < answer.size() - kEnd.size();) {
      const auto next = [&] {
        const std::string word = answer.c_str() + at;
        at = std::min(at + word.size() + 1, answer.size());
        return word;
      };
      Words& call = calls.emplace_back();
      call.push_back(next());
      const std::string count = next();
      for (int i = 0; i < atoi(count.c_str()); ++i) call.push_back(next());
    }
    std::sort(calls.begin(), calls.end());
    return calls;
  }

  const std::string& name() const { return name_; }

 private:
  void send(std::string_view text) const {
    while (!text.empty()) {
      const ssize_t sent = TEMP_FAILURE_RETRY(write(commands_, text.data(), text.size()));
      if (sent <= 0) fail("the shell", name_ + " has ended", "reads its commands");
      text.remove_prefix(static_cast<size_t>(sent));
    }
  }
  std::string receive(const std::string& command) const {
    char piece[4096];
    // libFuzzer's timer interrupts it.
    const ssize_t size = TEMP_FAILURE_RETRY(read(answers_, piece, sizeof piece));
    if (size <= 0) fail("the shell has ended", name_ + ": " + shown(command), "answers");
    return {piece, static_cast<size_t>(size)};
  }

  std::string name_;
  const Folder& folder_;  // empty: a shell would leave there what it makes
  int commands_;
  int answers_;
  int other_;
};

std::string shownCalls(const std::vector<Words>& calls) {
  std::string all;
  for (const Words& call : calls) {
    for (const std::string& word : call) all += shown(word) + " ";
    all += "; ";
  }
  return all;
}

void expectInShells(std::vector<Words> expected) {
  const std::string& command = *command_of_library;
  expected.push_back({"status", "0"});
  std::sort(expected.begin(), expected.end());
  static const Folder folder;
  static std::array<Shell, 3> shells = {Shell({"/bin/dash"}, "C", folder),
                                        Shell({"/bin/bash", "--norc"}, "C", folder),
                                        Shell({"/bin/bash", "--norc"}, "C.UTF-8", folder)};
  for (Shell& shell : shells) {
    const std::vector<Words> ours = shell.run(command);
    if (ours != expected)
      fail((shell.name() + ": " + shown(command)).c_str(), shownCalls(ours), shownCalls(expected));
  }
}

// ---- The library ----

// Exactly as long as the text, so that the sanitizer reports what is read after it.
std::unique_ptr<char[]> exact(const std::string& text) {
  auto copy = std::make_unique<char[]>(text.size() + 1);
  memcpy(copy.get(), text.c_str(), text.size() + 1);
  return copy;
}

template <typename Call>
auto called(Call call) {
  command_of_library.reset();
  is_library_called = true;
  const auto result = call();
  is_library_called = false;
  return result;
}

void expectCommand(const std::string& expected) {
  expectSame("the library's command", command_of_library.value_or("none"), expected);
}

void checkText(const std::string& text) {
  const auto copy = exact(text);
  expectSame("checkForMetaChars", checkForMetaChars(copy.get()), !passes(text));
  expectSame("the text after checkForMetaChars", copy.get(), text);
}

void checkOptions(const Words& texts, int count, size_t null_at) {
  std::vector<std::unique_ptr<char[]>> owned;
  std::vector<char*> argv = {nullptr};  // the first one is not looked at
  bool expected = false;
  bool is_ended = false;
  for (size_t i = 0; i < texts.size(); ++i) {
    if (i == null_at) is_ended = true;
    owned.push_back(exact(texts[i]));
    argv.push_back(i == null_at ? nullptr : owned.back().get());
    if (!is_ended && static_cast<long>(i) < count && !passes(texts[i])) expected = true;
  }
  argv.push_back(nullptr);
  expectSame("checkOptionsForMetaChars", checkOptionsForMetaChars(count, argv.data()), expected);
}

void checkStart(const std::string& text) {
  // In the shells, "words" is the program, and ./vrarun its first argument.
  const int result = called([&] { return startProcess("words .", exact(text).get()); });
  if (!passes(text)) {
    expectSame("startProcess", result, OSUTILS_PARAM_ERROR);
    expectSame("the library's command", command_of_library.value_or("none"), "none");
    return;
  }
  expectSame("startProcess", result, 0);
  expectCommand("words ./vrarun " + text + " > /dev/null 2>&1");
  Words expected = {"words", "./vrarun"};
  (void)appendWords(expected, text);
  expectInShells({expected});
}

void checkFind(const std::string& pid, const std::string& program) {
  const bool result =
      called([&] { return isProcessStarted(exact(pid).get(), exact(program).get()); });
  if (!passes(pid) || !passes(program)) {
    expectSame("isProcessStarted", result, 0);
    expectSame("the library's command", command_of_library.value_or("none"), "none");
    return;
  }
  expectSame("isProcessStarted", result, 1);
  expectCommand("ps -e -o pid -o comm | grep " + pid + "[\\ ] | grep " + program +
                " | grep -v \\<defunct\\> > /dev/null 2>&1");
  std::vector<Words> expected = {{"ps", "-e", "-o", "pid", "-o", "comm"}, {"grep"}};
  if (appendWords(expected.back(), pid)) {
    if (endsInWord(pid)) {
      expected.back().back() += "[ ]";
    } else {
      expected.back().push_back("[ ]");
    }
    expected.push_back({"grep"});
    if (appendWords(expected.back(), program)) expected.push_back({"grep", "-v", "<defunct>"});
  }
  expectInShells(expected);
}

}  // namespace

// Only notes the library's command. libFuzzer's own commands run.
extern "C" __attribute__((visibility("default"))) int system(const char* command) {
  if (is_library_called) {
    command_of_library = command;
    return 0;
  }
  static const auto original = reinterpret_cast<int (*)(const char*)>(dlsym(RTLD_NEXT, "system"));
  return original(command);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kLongest) return -1;
  Input input(data, size);
  const int count = input.number<int8_t>();
  const size_t null_at = input.byte();
  Words texts;
  while (!input.isAtEnd()) texts.push_back(input.text());

  for (const std::string& text : texts) checkText(text);
  checkOptions(texts, count, null_at);
  if (!texts.empty()) checkStart(texts[0]);
  if (texts.size() > 1) checkFind(texts[0], texts[1]);
  return 0;
}
