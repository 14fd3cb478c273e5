// The tool in this process, with arguments and standard input from the fuzzer. Which commands there
// are, and what its documents promise of each, is written down here once more.
//
// Nothing but a scratch directory can be changed meanwhile. No signal is sent and no shell is run.

// clang-format off
// These headers would take most of the time.
#pragma clang attribute push(__attribute__((no_sanitize("address", "undefined", "coverage"))), apply_to = function)
#include <CLI/CLI.hpp>
#include <charconv>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#pragma clang attribute pop
#define main mainOfTool
#include "../tools/osutils.cpp"
#undef main
#include "../tools/program.cpp"
#include "../tools/command.cpp"
#include "../tools/answer.cpp"
#include "../tools/verbose.cpp"
#include "../tools/difference.cpp"
#include "../tools/edit_lock.cpp"
#include "../tools/edited_file.cpp"
#include "../tools/services.cpp"
#include "../tools/inittab.cpp"
#include "../tools/paths.cpp"
#include "../tools/files.cpp"
#include "../tools/accounts.cpp"
#include "../tools/checks.cpp"
#include "../tools/processes.cpp"
#include "../tools/network.cpp"
#include "../tools/names.cpp"
// clang-format on

#include <stddef.h>
#include <stdio_ext.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <fstream>
#include <iostream>

#include "dn_model.h"
#include "fuzz.h"
#include "inittab_model.h"
#include "json.h"
#include "services_model.h"

namespace {

namespace fs = std::filesystem;

using Words = std::vector<std::string>;

constexpr size_t kLongestInput = 2000;
constexpr int kMaxTraces = 20'000;  // each may take memory that is never freed

// ---- What is promised ----

enum Kind { kShows, kAsks, kChanges };

// Options that take a value have a "=".
struct Described {
  const char* name;
  Kind kind;
  const char* options;
  size_t fewest;
  size_t most;
};

constexpr const char* kOwnership = "--owner= --group= --mode=";
constexpr size_t kAny = SIZE_MAX;

const Described kCommands[] = {
    {"help", kShows, "", 0, kAny},
    {"services list", kShows, "--file= --backup=", 0, 0},
    {"services add", kChanges, "--file= --backup= --no-lock --discard-backup --force", 2, 2},
    {"services delete", kChanges, "--file= --backup= --no-lock --discard-backup", 1, 1},
    {"services restore", kChanges, "--file= --backup= --no-lock --yes --force", 0, 0},
    {"services port", kShows, "--file= --backup=", 1, 1},
    {"services free-port", kShows, "--file= --backup= --unused", 0, 1},
    {"inittab list", kShows, "--file= --backup=", 0, 0},
    {"inittab add", kChanges, "--file= --backup= --no-lock --discard-backup --force", 4, 4},
    {"inittab delete", kChanges, "--file= --backup= --no-lock --discard-backup", 1, 1},
    {"inittab restore", kChanges, "--file= --backup= --no-lock --yes --force", 0, 0},
    {"inittab find", kShows, "--file= --backup=", 1, 1},
    {"inittab free-id", kShows, "--file= --backup=", 0, 0},
    {"paths", kShows, "--schema=", 0, 0},
    {"db", kShows, "--instance= --location= --migration=", 0, 0},
    {"file stat", kShows, "", 1, 1},
    {"file check", kShows, "", 1, 1},
    {"file copy", kChanges, kOwnership, 2, 2},
    {"file create", kChanges, "--owner= --group= --mode= --force", 1, 1},
    {"file delete", kChanges, "", 1, 1},
    {"file clear", kChanges, "", 1, 1},
    {"file owner", kChanges, kOwnership, 1, 1},
    {"dir create", kChanges, kOwnership, 1, 1},
    {"dir delete", kChanges, "--force", 1, 1},
    {"dir trim", kShows, "", 1, 1},
    {"space", kAsks, "", 2, 2},
    {"user exists", kAsks, "", 1, 1},
    {"user valid", kShows, "", 1, 1},
    {"user home", kShows, "", 1, 1},
    {"user group", kShows, "", 1, 1},
    {"group exists", kAsks, "", 1, 1},
    {"group members", kShows, "", 1, 1},
    {"group has", kAsks, "", 2, 2},
    {"name check", kAsks, "", 1, 1},
    {"screen", kAsks, "", 1, kAny},
    {"time", kShows, "--compact", 0, 0},
    {"process start", kChanges, "--launcher-dir=", 1, kAny},
    {"process stop", kChanges, "", 1, 1},
    {"process status", kAsks, "", 2, 2},
    {"platform", kShows, "", 0, 0},
    {"module check", kShows, "", 1, 2},
    {"net addresses", kShows, "--localhost --interfaces", 0, 0},
    {"net check", kAsks, "", 1, 1},
    {"net resolve", kShows, "", 1, 1},
    {"dn format", kShows, "--quiet", 0, 1},
    {"dn compare", kAsks, "--quiet", 0, 2},
};

// The actions that init knows.
constexpr const char* kActions[] = {"respawn",      "wait",       "once",      "boot",
                                    "bootwait",     "off",        "ondemand",  "initdefault",
                                    "sysinit",      "powerwait",  "powerfail", "powerokwait",
                                    "powerfailnow", "ctrlaltdel", "kbrequest"};

// A command line as the documents say that it is read.
struct Line {
  enum Meaning { kWrong, kHelpText, kDescription, kVersion, kRun } meaning = kWrong;
  const Described* command = nullptr;
  size_t after_command = 0;                    // the index of the next word
  std::map<std::string, std::string> options;  // with their values
  Words texts;

  bool has(const char* option) const { return options.contains(option); }
};

bool isCommand(const std::string& name) {
  return std::any_of(std::begin(kCommands), std::end(kCommands),
                     [&](const Described& each) { return each.name == name; });
}
bool isFamilyName(const std::string& name) {
  return std::any_of(std::begin(kCommands), std::end(kCommands), [&](const Described& each) {
    return name.empty() || std::string(each.name).starts_with(name + " ");
  });
}
std::string joined(const std::string& family, const std::string& name) {
  return family.empty() ? name : family + " " + name;
}

// Whether the word goes on with a command. One with a space in it is none of a command's two words.
bool goesOn(const std::string& command, const std::string& word) {
  if (word.empty() || word.find(' ') != std::string::npos) return false;
  return isCommand(joined(command, word)) || isFamilyName(joined(command, word));
}

// 1: known, 2: takes a value.
int kindOfOption(const std::string& command, const std::string& option) {
  std::string known = " --json --verbose --trace= --help -h";
  if (command.empty()) known += " --version";
  for (const Described& each : kCommands) {
    if (each.name != command) continue;
    known += std::string(" ") + each.options;
    if (each.kind == kChanges) known += " --dry-run";
  }
  known += " ";
  if (option.find_first_of(" =") != std::string::npos) return 0;
  if (known.find(" " + option + " ") != std::string::npos) return 1;
  return known.find(" " + option + "= ") != std::string::npos ? 2 : 0;
}

Line read(const Words& words) {
  Line line;
  std::string command;
  size_t at = 0;
  for (; at < words.size() && words[at] != "--"; ++at) {
    const std::string& word = words[at];
    if (!word.starts_with("-")) {
      if (!goesOn(command, word)) break;
      command = joined(command, word);
      line.after_command = at + 1;
      continue;
    }
    const size_t equals = word.find('=');
    const std::string option = word.substr(0, equals);
    const int kind = kindOfOption(command, option);
    if (kind == 0 || (kind == 1 && equals != std::string::npos)) return line;
    if (kind == 2) {
      if (equals == std::string::npos && ++at == words.size()) return line;
      const std::string value = equals == std::string::npos ? words[at] : word.substr(equals + 1);
      if (!line.options.emplace(option, value).second) return line;
      continue;
    }
    if (option == "--help" || option == "-h" || option == "--version") {
      line.meaning = option == "--version" ? Line::kVersion : Line::kHelpText;
      return line;
    }
    line.options.emplace(option, "");
  }
  if (!isCommand(command)) return line;
  for (const Described& each : kCommands) {
    if (each.name == command) line.command = &each;
  }
  if (at < words.size() && words[at] == "--") ++at;
  line.texts.assign(words.begin() + static_cast<ptrdiff_t>(at), words.end());
  if (command == "help") {
    std::string described;
    for (const std::string& text : line.texts) {
      if (!goesOn(described, text)) return line;
      described = joined(described, text);
    }
    line.meaning = line.has("--json") ? Line::kDescription : Line::kHelpText;
    return line;
  }
  if (line.texts.size() < line.command->fewest || line.texts.size() > line.command->most)
    return line;
  const bool has_instance = line.has("--instance"), has_location = line.has("--location");
  if (has_instance != has_location || (has_instance && line.has("--migration"))) return line;
  if (line.has("--localhost") && line.has("--interfaces")) return line;
  if (line.has("--backup") && line.options.at("--backup").empty()) return line;
  line.meaning = Line::kRun;
  return line;
}

bool isMetaCharacter(char c) {
  return c != '\0' && strchr("&;`'\"|*?~<>^()[]{}$\n\r\\", c) != nullptr;
}

bool passesScreening(const std::string& text) {
  return std::none_of(text.begin(), text.end(), isMetaCharacter);
}

bool isPlainWord(const std::string& text) {
  return !text.empty() && text.front() != '-' && passesScreening(text) &&
         text.find_first_of(" \t#") == std::string::npos;
}

bool isGoodName(const std::string& name) {
  if (name.empty() || name.size() > 8 || !isalpha(static_cast<unsigned char>(name[0])))
    return false;
  for (const char c : name) {
    if (!isalnum(static_cast<unsigned char>(c)) && c != '_') return false;
  }
  for (const char* const start : {"orx", "sql", "sys"}) {
    if (strncasecmp(name.c_str(), start, 3) == 0) return false;
  }
  for (const char* const reserved : {"Users", "Admins", "guests", "public", "local"}) {
    if (strcasecmp(name.c_str(), reserved) == 0) return false;
  }
  return true;
}

// ---- The world of the tool ----

// The scratch directory: the mode, the owners, and what a regular file contains or a link names.
struct Entry {
  mode_t mode;
  uid_t user;
  gid_t group;
  std::string contents;
  bool operator==(const Entry&) const = default;
};
using Tree = std::map<std::string, Entry>;

// The properties files that `db` reads, and what is in them.
struct Database {
  const char* file;
  const char* path;
  const char* version;
};
constexpr Database kDatabases[] = {
    {"home/etc/ldapdb.properties", "/opt/db", "8.1"},
    {"home/vraslapd-inst1/etc/ldapdb.properties", "/opt/db of inst1", "9.5.0.4"},
    {"migration/etc/xq4info", "/opt/old", "7.2"},
};

class Scratch {
 public:
  Scratch() {
    struct statvfs root;
    if (geteuid() != 0 || statvfs("/", &root) != 0 || (root.f_flag & ST_RDONLY) == 0)
      fail("the machine can be changed", "no", "tests/apart --writable FOLDER COMMAND");
    if (mount("tmpfs", path_.c_str(), "tmpfs", 0, "size=16m") != 0) giveUp("tmpfs");
    for (const char* const place :
         {"/proc", "/sys", "/dev", "/dev/shm", "/dev/pts", "/etc", "/run"}) {
      constexpr unsigned long kReadOnly = MS_BIND | MS_REMOUNT | MS_RDONLY;
      struct statvfs system;
      if (mount(nullptr, place, nullptr, kReadOnly, nullptr) != 0 &&
          (statvfs(place, &system) != 0 || (system.f_flag & ST_RDONLY) == 0))
        giveUp(place);
    }
    enter();
    setenv("VRA_LDAP_HOME", folder_.path("home").c_str(), 1);
    for (const char* const name :
         {"TRC_DIR", "TRC_EVENTS", "TRC_MAX_BYTES", "TRC_MODE", "PRINT_DEBUG"})
      unsetenv(name);
    fill();
    first_ = tree();
    leave();
  }
  ~Scratch() { (void)umount2(path_.c_str(), MNT_DETACH); }

  void enter() const {
    if (chdir(path_.c_str()) != 0) giveUp(path_);
  }
  // libFuzzer may have been given relative paths.
  void leave() const {
    if (fchdir(outside_) != 0) giveUp("the folder outside");
  }

  const Tree& first() const { return first_; }

  static Tree tree() {
    Tree all;
    for (const auto& entry : fs::recursive_directory_iterator(".")) {
      struct stat status = {};
      (void)lstat(entry.path().c_str(), &status);
      std::string text;
      if (S_ISLNK(status.st_mode)) text = fs::read_symlink(entry);
      if (S_ISREG(status.st_mode)) {
        std::ifstream file(entry.path(), std::ios::binary);
        text.append(std::istreambuf_iterator<char>(file), {});
      }
      all[entry.path().string().substr(2)] = {status.st_mode, status.st_uid, status.st_gid, text};
    }
    return all;
  }

  void restore() const {
    for (const auto& entry : fs::directory_iterator(".")) fs::remove_all(entry);
    fill();
  }

 private:
  static void fill() {
    (void)umask(022);
    for (const char* const name :
         {"dir", "dir/in", "none", "sbin", "home", "home/etc", "home/vraslapd-inst1",
          "home/vraslapd-inst1/etc", "migration", "migration/etc"})
      (void)mkdir(name, 0755);
    const std::pair<const char*, const char*> files[] = {
        {"file", "text\n"},
        {"empty", ""},
        {"dir/file", "x"},
        {"services", "ldap\t389/tcp\t# LDAP\nldap 389/udp\nvraslapd 3700/tcp\n"},
        {"inittab", "id:2:initdefault:\ndb1:2345:respawn:/bin/vraslapd -n inst1\n"},
        {"cut", "a 1/tcp\n"},
        {"cut.vrasave", "a 1/tcp\nb 2/tcp\n"},
        {"sbin/vrarun", "#!/bin/sh\n"},
    };
    for (const auto& [name, contents] : files) std::ofstream(name) << contents;
    for (const auto& [name, path, version] : kDatabases) {
      std::ofstream(name) << "currentXQ4InstallPath=" << path << "\ncurrentXQ4Version=" << version
                          << '\n';
    }
    (void)chmod("sbin/vrarun", 0755);
    (void)symlink("file", "link");
    (void)symlink("missing", "dangling");
  }

  Folder folder_;
  std::string path_ = folder_.path("");
  int outside_ = open(".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  Tree first_;
};

// What the tool did to the world outside.
struct Effects {
  bool is_running = false;
  int commands = 0;
  int signals = 0;
  std::string last_command;
};
Effects effects;

// A stream of the tool that adds to a text.
class Captured {
 public:
  explicit Captured(FILE*& stream) : stream_(stream), original_(stream) {
    cookie_io_functions_t functions = {};
    functions.write = [](void* self, const char* text, size_t size) {
      static_cast<Captured*>(self)->text_.append(text, size);
      return static_cast<ssize_t>(size);
    };
    functions.close = [](void* self) {
      static_cast<Captured*>(self)->is_open_ = false;
      return 0;
    };
    stream_ = fopencookie(this, "w", functions);
    setvbuf(stream_, nullptr, _IONBF, 0);
  }
  ~Captured() { stop(); }
  Captured(const Captured&) = delete;
  Captured& operator=(const Captured&) = delete;

  const std::string& stop() {
    if (is_open_) (void)fclose(stream_);
    stream_ = original_;
    return text_;
  }

 private:
  FILE*& stream_;
  FILE* original_;
  bool is_open_ = true;
  std::string text_;
};

void setStandardInput(const std::string& text) {
  static const int file = memfd_create("stdin", MFD_CLOEXEC);
  if (ftruncate(file, 0) != 0 || pwrite(file, text.data(), text.size(), 0) < 0 ||
      lseek(file, 0, SEEK_SET) != 0 || dup2(file, 0) != 0)
    giveUp("standard input");
  __fpurge(stdin);
  clearerr(stdin);
  std::cin.clear();
}

struct Outcome {
  int status;
  std::string out;
  std::string err;
};

// Begins with the state of a new process.
Outcome runTool(Words words, const std::string& input) {
  using VRAOSUtils::EtcInittab;
  using VRAOSUtils::EtcServices;
  static const char* const paths[] = {
      EtcServices::ETC_SERVICES_FILE, EtcServices::ETC_SERVICES_FILE_BACKUP,
      EtcInittab::ETC_INITTAB_FILE, EtcInittab::ETC_INITTAB_FILE_BACKUP};
  EtcServices::ETC_SERVICES_FILE = paths[0];
  EtcServices::ETC_SERVICES_FILE_BACKUP = paths[1];
  EtcInittab::ETC_INITTAB_FILE = paths[2];
  EtcInittab::ETC_INITTAB_FILE_BACKUP = paths[3];
  g_isCallerVraImigr = g_loadLocalXQ4Path = 0;
  trcEvents = 0;
  is_verbose = false;
  keeps_debug_records = true;
  for (const char* const name : {"TRC_DIR", "TRC_EVENTS"}) unsetenv(name);
  (void)umask(022);
  setStandardInput(input);

  std::string program = "osutils";
  std::vector<char*> argv = {program.data()};
  for (std::string& word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  effects = {};
  effects.is_running = true;
  Captured out(stdout);
  Captured err(stderr);
  const int status = mainOfTool(static_cast<int>(argv.size()) - 1, argv.data());
  effects.is_running = false;
  return {status, out.stop(), err.stop()};
}

// ---- Comparison ----

std::string shownLine(const Words& words) {
  std::string line;
  for (const std::string& word : words) line += shown(word) + " ";
  return line;
}

// Whether the exit status of a dry run is that of the command. It does not know that a place outside
// is read-only, nor that restore has no terminal to ask on.
bool mustAgree(const Line& line) {
  const auto isInside = [](const std::string& path) {
    std::error_code unknown;
    const std::string real = fs::weakly_canonical(fs::absolute(path), unknown);
    return real.starts_with(fs::current_path().string() + "/");
  };
  const std::string name = line.command->name;
  if (line.has("--dry-run") || (name.ends_with("restore") && !line.has("--yes"))) return false;
  return name != "file owner" || isInside(line.texts[0]);
}

class Checker {
 public:
  Checker(const Words& words, const Line& line, const Outcome& ours)
      : words_(words), line_(line), ours_(ours) {}

  void check(const Tree& before, const Tree& after) const {
    if (ours_.status < 0 || ours_.status > 3) wrong("the exit status", "0 to 3");
    switch (line_.meaning) {
      case Line::kWrong:
        require(ours_.status == 2, "the exit status", "2 for wrong usage");
        break;
      case Line::kHelpText:
        require(ours_.status == 0 && ours_.out.find("Usage: ") != std::string::npos, "help",
                "a text");
        break;
      case Line::kDescription:
        require(ours_.status == 0 && JsonChecker(ours_.out).isValid() &&
                    ours_.out.find("\"description\":") != std::string::npos,
                "help", "a description in JSON");
        break;
      case Line::kVersion:
        require(ours_.status == 0 && ours_.out == "osutils " OSUTILS_VERSION "\n", "version", "it");
        break;
      case Line::kRun:
        require(ours_.status != 1 || line_.command->kind == kAsks, "1", "only for a question");
        checkAnswers();
        checkDatabase();
        checkServices(before, after);
        checkInittab(before, after);
        checkRestoration(before, after);
        checkFiles(before, after);
        break;
    }
    checkStreams();
    checkChanges(before, after);
  }

 private:
  [[noreturn]] void wrong(const char* what, const std::string& expected) const {
    fail((std::string(what) + " of " + shownLine(words_)).c_str(),
         "status " + std::to_string(ours_.status) + "\n" + ours_.out + ours_.err, expected);
  }
  void require(bool holds, const char* what, const std::string& expected) const {
    if (!holds) wrong(what, expected);
  }

  bool isRun(std::initializer_list<const char*> commands) const {
    return line_.meaning == Line::kRun &&
           std::any_of(commands.begin(), commands.end(),
                       [&](const char* name) { return strcmp(name, line_.command->name) == 0; });
  }

  void checkStreams() const {
    const bool has_answer = ours_.status < 2;
    if (!has_answer) {
      // dn answers for the good lines of its input.
      if (!isRun({"dn format"})) require(ours_.out.empty(), "standard output", "nothing");
      checkReason();
      return;
    }
    const bool may_warn =
        line_.has("--verbose") || isRun({"dn format", "dn compare", "db", "services restore",
                                         "inittab restore", "net addresses", "net check"});
    if (!may_warn) require(ours_.err.empty(), "standard error", "nothing");
    require(ours_.out.empty() || ours_.out.ends_with('\n'), "standard output", "whole lines");
    if (line_.meaning == Line::kRun && line_.has("--json")) {
      require(ours_.out.find('\n') == ours_.out.size() - 1, "the JSON", "one line");
      require(JsonChecker(ours_.out).isValid(), "the answer", "valid JSON");
    }
    require(!hasControls(ours_.out), "standard output", "no control characters");
  }

  // JSON leaves those from U+007F on alone.
  bool hasControls(const std::string& text) const {
    for (size_t i = 0; i < text.size(); ++i) {
      const auto byte = static_cast<unsigned char>(text[i]);
      if (byte < ' ' && byte != '\n' && byte != '\t') return true;
      if (line_.has("--json")) continue;
      if (byte == 0x7F) return true;
      if (byte == 0xC2 && i + 1 < text.size() && (text[i + 1] & 0xE0) == 0x80) return true;
    }
    return false;
  }

  // The last line names the command and the result code, except where a command has lines of its own.
  void checkReason() const {
    const std::string& err = ours_.err;
    require(err.ends_with('\n'), "standard error", "a line");
    const size_t begin = err.size() < 2 ? 0 : err.rfind('\n', err.size() - 2) + 1;
    const std::string last = err.substr(begin);
    const bool may_have_more =
        line_.has("--verbose") || isRun({"dn format", "dn compare", "db", "services restore",
                                         "inittab restore", "net addresses", "net check"});
    if (!may_have_more) require(begin == 0, "standard error", "one line");
    if (isRun({"dn format", "dn compare", "db"})) {  // a line of its own, and --verbose may follow
      require(err.starts_with("osutils: ") || err.find("\nosutils: ") != std::string::npos,
              "standard error", "a line that begins with the program's name");
      return;
    }
    require(last.starts_with("osutils: "), "the reason", "begins with the program's name");
    const bool is_usage = last.find("parameter error (89): ") != std::string::npos;
    require(is_usage == (ours_.status == 2), "the result code", "89 for wrong usage alone");
    if (line_.meaning == Line::kRun) {
      const std::string name = std::string("osutils: ") + line_.command->name + ": ";
      require(last.starts_with(name), "the reason", name);
      require(namesCode(last), "the reason", "a result code");
    }
  }

  // " (32)"
  static bool namesCode(const std::string& text) {
    for (size_t at = 0; (at = text.find(" (", at)) != std::string::npos; ++at) {
      const size_t end = text.find_first_not_of("0123456789", at + 2);
      if (end != std::string::npos && end > at + 2 && text[end] == ')') return true;
    }
    return false;
  }

  void checkChanges(const Tree& before, const Tree& after) const {
    const bool may_change =
        line_.meaning == Line::kRun && line_.command->kind == kChanges && !line_.has("--dry-run");
    const bool asks_shell = isRun({"user valid", "process status"});
    require(may_change || asks_shell || effects.commands == 0, "a command for the shell", "none");
    require(may_change || effects.signals == 0, "a signal", "none");
    if (line_.has("--trace") || before == after) return;
    require(may_change, "the scratch directory", "is unchanged");
    for (const auto& [path, contents] : after) {
      const auto old = before.find(path);
      if (old == before.end() || old->second != contents) requireNamed(path);
    }
    for (const auto& [path, contents] : before) {
      if (!after.contains(path)) requireNamed(path);
    }
  }

  // A path that was changed is one of the arguments, or below it, or a file's lock or copy.
  void requireNamed(const std::string& path) const {
    Words named = line_.texts;
    for (const char* const option : {"--file", "--backup"}) {
      if (line_.has(option)) named.push_back(line_.options.at(option));
    }
    for (const std::string& name : named) {
      if (name.empty()) {
        if (path == ".lock" || path == ".vrasave") return;
        continue;
      }
      std::error_code unknown;
      const std::string real =
          fs::weakly_canonical(name, unknown).lexically_relative(fs::current_path());
      const std::string plain = fs::path(name).lexically_normal().lexically_relative(".");
      for (const std::string& at :
           {real, plain,
            std::string(
                fs::absolute(name).lexically_normal().lexically_relative(fs::current_path()))}) {
        std::string wanted = at;
        while (wanted.ends_with('/')) wanted.pop_back();
        if (wanted == "." || path == wanted || path.starts_with(wanted + "/") ||
            path == wanted + ".lock" || path == wanted + ".vrasave")
          return;
      }
      if (name.find("link") != std::string::npos || name.find("dangling") != std::string::npos)
        return;
    }
    wrong("a change", path + " is not changed");
  }

  // The answers that need nothing but the texts.
  void checkAnswers() const {
    const Words& texts = line_.texts;
    if (isRun({"screen"})) {
      const bool passes = std::all_of(texts.begin(), texts.end(), passesScreening);
      require(ours_.status == (passes ? 0 : 1), "screen", passes ? "yes" : "no");
    } else if (isRun({"name check"})) {
      require(ours_.status == (isGoodName(texts[0]) ? 0 : 1), "name check", "the other answer");
    } else if (isRun({"process stop"})) {
      require(ours_.status != 0 || line_.has("--dry-run") || effects.signals == 1, "stop",
              "a signal");
    } else if (isRun({"user exists"})) {
      require(ours_.status == (getpwnam(texts[0].c_str()) != nullptr ? 0 : 1), "exists", "other");
    } else if (isRun({"group exists"})) {
      require(ours_.status == (getgrnam(texts[0].c_str()) != nullptr ? 0 : 1), "exists", "other");
    } else if (isRun({"dn compare"}) && texts.size() == 2) {
      const auto form = [](const std::string& name) {
        return name.empty() ? "" : modelOfFormattedDn(name);
      };
      const bool equal = !texts[0].empty() && !texts[1].empty() && form(texts[0]) == form(texts[1]);
      require(ours_.status == (equal ? 0 : 1), "dn compare", equal ? "yes" : "no");
    } else if (isRun({"dn format"}) && texts.size() == 1 && line_.has("--json") &&
               ours_.status == 0) {
      const std::string expected =
          Answer{{"name", texts[0]}, {"formatted", modelOfFormattedDn(texts[0])}}.dump(
              -1, ' ', false, Answer::error_handler_t::replace);
      require(ours_.out == expected + "\n", "dn format", expected);
    } else if (isRun({"file stat"}) && line_.has("--json") && ours_.status == 0) {
      struct stat status;
      const bool exists = stat(texts[0].c_str(), &status) == 0;
      const Answer answer = Answer::parse(ours_.out);
      require(answer["exists"] == exists, "file stat", exists ? "exists" : "does not exist");
      require(answer["directory"] == (exists && (status.st_mode & 0x4000) != 0), "stat",
              "directory");
      require(answer["file"] == (exists && (status.st_mode & 0x8000) != 0), "stat", "file");
    }
  }

  void requireAnswer(const Answer& expected) const {
    const std::string text = line_.has("--json") ? jsonOf(expected) : tableOf(expected);
    require(ours_.out == text, "the answer", text);
  }
  // `success`: whether a command that shows something finds it. The trace may fail too.
  void requireAnswerIf(bool success, const Answer& expected) const {
    require((ours_.status == 0) == success || line_.has("--trace"), "the exit status",
            success ? "0" : "a failure");
    if (ours_.status == 0) requireAnswer(expected);
  }

  // ---- What is in files ----

  // What a regular file of the scratch directory has.
  static std::optional<std::string> contentsIn(const Tree& tree, const std::string& path) {
    if (path.empty() || path.ends_with('/')) return std::nullopt;
    std::error_code unknown;
    const fs::path real = fs::weakly_canonical(fs::absolute(path), unknown);
    const auto found = tree.find(real.lexically_relative(fs::current_path()));
    if (found == tree.end() || !S_ISREG(found->second.mode)) return std::nullopt;
    return found->second.contents;
  }

  std::string option(const char* name) const {
    const auto found = line_.options.find(name);
    return found == line_.options.end() ? "" : found->second;
  }
  bool isDone() const { return ours_.status == 0 && !line_.has("--dry-run"); }

  void checkDatabase() const {
    if (!isRun({"db"})) return;
    std::string file = "home/etc/ldapdb.properties";
    if (line_.has("--migration")) file = option("--migration") + "/etc/xq4info";
    if (line_.has("--instance")) {
      file = option("--location") + "/vraslapd-" + option("--instance") + "/etc/ldapdb.properties";
    }
    std::error_code unknown;
    const auto* const database = std::find_if(
        std::begin(kDatabases), std::end(kDatabases),
        [&](const Database& each) { return fs::equivalent(file, each.file, unknown); });
    if (database == std::end(kDatabases)) {
      requireAnswerIf(false, nullptr);
    } else {
      requireAnswerIf(true, {{"path", database->path}, {"version", database->version}});
    }
  }

  // What the edit leaves, and that it is made where nothing is in its way: the file has no copy and ends with a line.
  void checkEdit(const Tree& after, const std::string& before, bool success,
                 const std::string& edited) const {
    const std::string& file = line_.options.at("--file");
    if (ours_.status == 0) require(success, "the edit", "a failure");
    const bool is_plain = (file == "services" || file == "inittab") && !line_.has("--backup");
    if (success && is_plain && !line_.has("--trace"))
      require(ours_.status == 0, "the edit", "success");
    const std::string& expected = isDone() ? edited : before;
    const std::optional<std::string> now = contentsIn(after, file);
    require(now == expected, "the file",
            shown(expected) + ", not " + shown(now.value_or("(none)")));
  }

  void checkServices(const Tree& before, const Tree& after) const {
    const std::optional<std::string> text = contentsIn(before, option("--file"));
    const Words& texts = line_.texts;
    if (!text || !std::string_view(line_.command->name).starts_with("services ")) return;
    ServicesModel model(*text);
    (void)model.read();
    if (isRun({"services list"})) {
      Answer list = Answer::array();
      for (const Service& each : model.list())
        list.push_back({{"name", each.name}, {"port", each.port}});
      requireAnswerIf(true, list);
    } else if (isRun({"services port"})) {
      requireAnswerIf(model.has(texts[0]), {{"name", texts[0]}, {"port", model.portOf(texts[0])}});
    } else if (isRun({"services free-port"}) && !line_.has("--unused")) {
      const std::optional<int> start = texts.empty() ? 3700 : portIn(texts[0]);
      const int port = start ? model.freePort(*start) : -1;
      requireAnswerIf(port != -1 && port <= 65535, {{"port", port}});
    } else if (isRun({"services add"})) {
      const int port = portIn(texts[1]).value_or(0);
      const bool added =
          isServiceName(texts[0], port) && model.add(texts[0], port) == OSUTILS_SUCCESS;
      checkEdit(after, *text, added, model.contents());
      if (isDone()) requireAnswer({{"name", texts[0]}, {"port", port}});
    } else if (isRun({"services delete"})) {
      const bool removed = model.remove(texts[0]) == OSUTILS_SUCCESS;
      checkEdit(after, *text, removed, model.contents());
    }
  }

  static std::optional<int> portIn(const std::string& text) {
    int number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return number;
  }
  // What `add` takes: with --force all that the editor reads back.
  bool isServiceName(const std::string& name, int port) const {
    if (name.empty() || name.size() > 90 || kLetters.find(name[0]) == std::string::npos)
      return false;
    for (const char c : name) {
      if (static_cast<unsigned char>(c) <= ' ' || c == '\x7f') return false;
    }
    return line_.has("--force") || (port <= 65535 && name.find_first_of("#/") == std::string::npos);
  }

  void checkInittab(const Tree& before, const Tree& after) const {
    const std::optional<std::string> text = contentsIn(before, option("--file"));
    const Words& texts = line_.texts;
    if (!text || !std::string_view(line_.command->name).starts_with("inittab ")) return;
    const auto answer = [](const std::string& record) {
      return Answer{{"id", upToNul(record.substr(0, 10))},
                    {"runlevels", upToNul(record.substr(10, 10))},
                    {"action", upToNul(record.substr(20, 30))},
                    {"process", upToNul(record.substr(kCommandOffset))}};
    };
    InittabModel model(*text);
    (void)model.read();
    if (isRun({"inittab list"})) {
      Answer list = Answer::array();
      for (const std::string& each : model.list()) list.push_back(answer(each));
      requireAnswerIf(true, list);
    } else if (isRun({"inittab find"})) {
      const std::string* const found = model.withCommand(texts[0]);
      requireAnswerIf(found != nullptr, found == nullptr ? nullptr : answer(*found));
    } else if (isRun({"inittab free-id"})) {
      requireAnswerIf(true, {{"id", model.freeId(VRAOSUtils::EtcInittab::ETC_INITTAB_PREFIX_ID)}});
    } else if (isRun({"inittab add"})) {
      const bool added = areInittabFields() &&
                         model.add(texts[0], texts[1], texts[2], texts[3]) == OSUTILS_SUCCESS;
      checkEdit(after, *text, added, model.contents());
      if (isDone()) requireAnswer(answer(modelRecord(texts[0], texts[1], texts[2], texts[3])));
    } else if (isRun({"inittab delete"})) {
      const bool removed = model.remove(texts[0]) == OSUTILS_SUCCESS;
      checkEdit(after, *text, removed, model.contents());
    }
  }

  // The fields that the editor reads back, with an action that init knows unless forced.
  bool areInittabFields() const {
    const Words& texts = line_.texts;
    const size_t most[] = {9, 9, 29, 256};
    for (size_t i = 0; i < 4; ++i) {
      const bool is_plain = std::none_of(texts[i].begin(), texts[i].end(), [](char c) {
        return static_cast<unsigned char>(c) < ' ' || c == '\x7f';
      });
      if (texts[i].size() > most[i] || !is_plain) return false;
      if (i < 3 && texts[i].find(':') != std::string::npos) return false;
    }
    const bool is_known =
        std::find(std::begin(kActions), std::end(kActions), texts[2]) != std::end(kActions);
    return !texts[0].empty() && (kDigits + kLetters).find(texts[0][0]) != std::string::npos &&
           (is_known || line_.has("--force"));
  }

  // The file has the copy, or all of it as its beginning, and the copy is gone.
  void checkRestoration(const Tree& before, const Tree& after) const {
    if (!isRun({"services restore", "inittab restore"}) || !isDone() || !line_.has("--file"))
      return;
    const std::string file = option("--file");
    const std::string backup = line_.has("--backup") ? option("--backup") : file + ".vrasave";
    const std::optional<std::string> copy = contentsIn(before, backup);
    if (!copy) return;
    const std::string text = contentsIn(before, file).value_or("");
    const bool is_redundant = text.starts_with(*copy) && !line_.has("--force");
    require(contentsIn(after, file) == (is_redundant ? text : *copy), "the file", "restored");
    require(!contentsIn(after, backup), "the copy", "none");
  }

  void checkFiles(const Tree& before, const Tree& after) const {
    const Words& texts = line_.texts;
    if (!isDone() || !std::string_view(line_.command->name).starts_with("file ")) return;
    struct stat status;
    if (isRun({"file delete"})) {
      require(lstat(texts[0].c_str(), &status) != 0, "the file", "none");
    } else if (isRun({"file clear", "file create"})) {
      const std::optional<std::string> now = contentsIn(after, texts[0]);
      require(now.value_or("").empty(), "the file", "empty");
    } else if (isRun({"file copy"})) {
      const std::optional<std::string> from = contentsIn(before, texts[0]);
      const std::optional<std::string> to = contentsIn(after, texts[1]);
      if (from && to) require(to == from, "the copy", shown(*from));
    }
  }

  const Words& words_;
  const Line& line_;
  const Outcome& ours_;
};

}  // namespace

#pragma GCC visibility push(default)
extern "C" {

int kill(pid_t process, int signal_number) noexcept {
  if (process < 1) fail("kill", std::to_string(process), "one process");
  if (signal_number != 0) ++effects.signals;
  errno = ESRCH;
  return process % 2 == 0 ? 0 : -1;
}

// Does what the tool's commands would do in the scratch directory.
int system(const char* command) {
  if (!effects.is_running) return -1;
  ++effects.commands;
  const std::string text = command;
  if (text.starts_with("rm -rf ")) {
    const std::string path = text.substr(7);
    if (!isPlainWord(path)) fail("a path for rm", shown(path), "one word");
    const std::string last = fs::path(path).filename();
    std::error_code error;
    if (last == "." || last == ".." || fs::equivalent(path, "/", error)) return 256;
    fs::remove_all(path, error);
    return error ? 256 : 0;
  }
  const size_t launcher = text.find("/vrarun ");
  if (launcher != std::string::npos && text.ends_with(" > /dev/null 2>&1") &&
      !text.starts_with("ps ")) {
    if (!isPlainWord(text.substr(0, launcher)) && launcher != 0)
      fail("a launcher", shown(text), "one word");
    const std::string program = text.substr(0, launcher) + "/vrarun";
    return access(program.c_str(), X_OK) == 0 ? 0 : 127 * 256;
  }
  constexpr std::string_view kSu = "/bin/su ", kRest = " -c \"exit 0\" >>/dev/null 2>>/dev/null ";
  if (text.starts_with(kSu) && text.ends_with(kRest)) {
    const std::string user = text.substr(kSu.size(), text.size() - kSu.size() - kRest.size());
    if (!isPlainWord(user)) fail("a user for su", shown(user), "one word");
    return 0;
  }
  if (text.starts_with("ps -e -o pid -o comm | grep "))
    return text.find('7') != text.npos ? 0 : 256;
  fail("a command for the shell", shown(text), "a known one");
}

}  // extern "C"
#pragma GCC visibility pop

namespace {

// Words that the mutator uses besides those of kCommands.
constexpr const char* kValues[] = {"file",        "empty",       "dir/file",  "none",
                                   "dir",         "new",         "none/new",  "link",
                                   "dangling",    "missing",     "missing/a", "./file",
                                   "dir/",        ".",           "..",        "",
                                   "/",           "services",    "inittab",   "cut",
                                   "cut.vrasave", "sbin",        "home",      "migration",
                                   "ldap",        "vraslapd",    "389",       "3700",
                                   "65535",       "65536",       "400001",    "-1",
                                   "0",           "1",           "4",         "2147483648",
                                   "99999999999", "644",         "4755",      "0",
                                   "8",           "root",        "daemon",    "nogroup",
                                   "nobody7",     "db1",         "id",        "2345",
                                   "respawn",     "/bin/x",      "a b",       "a;b",
                                   "#a",          "-n",          "--",        "cn=a",
                                   "CN = A",      "o=\\2C",      "127.0.0.1", "::1",
                                   "localhost",   "libc.so.6",   "malloc",    "6.1",
                                   "inst1",       "file/x",      "x\x1b[2J",  "\xc2\x85",
                                   "\xff",        "\xe2\x82\xac"};

class Mutator {
 public:
  explicit Mutator(unsigned seed) : next_(seed) {}

  size_t below(size_t bound) {
    next_ = next_ * 6364136223846793005U + 1442695040888963407U;
    return (next_ >> 33) % bound;
  }

  std::string word() {
    const Described& command = kCommands[below(std::size(kCommands))];
    const Words options = split(command.options, ' ');
    switch (below(6)) {
      case 0: {
        const Words names = split(command.name, ' ');
        return names[below(names.size())];
      }
      case 1:
        return options.empty() ? "--" : option(options[below(options.size())]);
      case 2: {
        constexpr const char* kCommon[] = {"--json", "--verbose", "--dry-run", "--help", "--"};
        return kCommon[below(std::size(kCommon))];
      }
      default:
        return value();
    }
  }

  // A command with some of its options and about as many texts as it takes.
  Words line() {
    const Described& command = kCommands[below(std::size(kCommands))];
    Words words = split(command.name, ' ');
    if (below(3) == 0) words.insert(words.begin(), "--json");
    for (const std::string& each : split(command.options, ' ')) {
      if (below(3) == 0) words.push_back(option(each));
    }
    if (words[0] == "services" && below(2) == 0) words.push_back("--file=services");
    if (words[0] == "inittab" && below(2) == 0) words.push_back("--file=inittab");
    const size_t texts =
        command.fewest + below(8) / 7 + (command.most > command.fewest ? below(2) : 0);
    for (size_t i = 0; i < texts; ++i) words.push_back(value());
    return words;
  }

  void change(Words& words) {
    const size_t at = below(words.size() + 1);
    const auto place = words.begin() + static_cast<ptrdiff_t>(at);
    switch (below(5)) {
      case 0:
        words = line();
        break;
      case 1:
        words.insert(place, word());
        break;
      case 2:
        if (at < words.size()) words.erase(place);
        break;
      default:
        if (at < words.size()) words[at] = at == 0 || below(2) == 0 ? word() : value();
    }
  }

  static Words split(const std::string& text, char separator) {
    Words parts;
    std::istringstream stream(text);
    for (std::string part; std::getline(stream, part, separator);) parts.push_back(part);
    return parts;
  }

 private:
  std::string value() { return kValues[below(std::size(kValues))]; }
  std::string option(const std::string& name) {
    return name.ends_with('=') ? name + value() : name;
  }

  uint64_t next_;
};

}  // namespace

extern "C" size_t LLVMFuzzerMutate(uint8_t* data, size_t size, size_t most);

// Changes words rather than bytes: nearly all other inputs are wrong usage.
extern "C" __attribute__((visibility("default"))) size_t LLVMFuzzerCustomMutator(uint8_t* data,
                                                                                 size_t size,
                                                                                 size_t most,
                                                                                 unsigned seed) {
  Mutator mutator(seed);
  if (mutator.below(4) == 0) return LLVMFuzzerMutate(data, size, most);
  Words words = Mutator::split(std::string(reinterpret_cast<char*>(data), size), '\n');
  for (size_t times = 1 + mutator.below(3); times > 0; --times) mutator.change(words);
  std::string text;
  for (const std::string& word : words) text += (text.empty() ? "" : "\n") + word;
  text.resize(std::min(text.size(), most));
  std::copy(text.begin(), text.end(), data);
  return text.size();
}

// Each line of the input is an argument, in which a NUL stands for a line feed; after a line "<"
// comes standard input.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const Scratch scratch;
  static int traces = 0;
  if (size > kLongestInput) return -1;
  Words words;
  std::string_view rest(reinterpret_cast<const char*>(data), size);
  while (!rest.empty()) {
    const size_t length = std::min(rest.find('\n'), rest.size());
    std::string word(rest.substr(0, length));
    rest.remove_prefix(std::min(length + 1, rest.size()));
    if (word == "<") break;
    std::replace(word.begin(), word.end(), '\0', '\n');
    words.push_back(word);
  }
  const Line line = read(words);
  if (line.has("--trace") && ++traces > kMaxTraces) return -1;

  scratch.enter();
  std::optional<Outcome> planned;
  if (line.meaning == Line::kRun && line.command->kind == kChanges && !line.has("--trace")) {
    Words dry = words;
    dry.insert(dry.begin() + static_cast<ptrdiff_t>(line.after_command), "--dry-run");
    planned = runTool(dry, std::string(rest));
    Checker(dry, read(dry), *planned).check(scratch.first(), Scratch::tree());
  }
  const Outcome ours = runTool(words, std::string(rest));
  const Tree after = Scratch::tree();
  Checker(words, line, ours).check(scratch.first(), after);
  if (planned && planned->status != ours.status && mustAgree(line)) {
    fail(("a dry run of " + shownLine(words)).c_str(), planned->out + planned->err,
         ours.out + ours.err);
  }
  if (after != scratch.first()) scratch.restore();
  scratch.leave();
  return 0;
}
