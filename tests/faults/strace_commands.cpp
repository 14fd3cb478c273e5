// The commands of the tool.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <map>
#include <sstream>

#include "report_page.h"
#include "strace_subjects.h"
#include "world.h"
#ifdef OSUTILS_TRACE
#include "made_trace.h"
#endif

namespace {

// ---- Files ----

const char* const kServices =
    "# services of the test\n"
    "ssh\t22/tcp\t# remote shell\n"
    "domain  53/tcp\n"
    "domain  53/udp\n"
    "ldap    389/tcp  directory\n";
const char* const kServicesWithoutDomain =
    "# services of the test\n"
    "ssh\t22/tcp\t# remote shell\n"
    "ldap    389/tcp  directory\n";
const char* const kInittab =
    "# inittab of the test\n"
    "id:2:initdefault:\n"
    "l0:0:wait:/etc/init.d/rc 0\n"
    "vra0:2345:respawn:/opt/a:b --x\n"
    "l0:6:wait:/etc/init.d/rc 6\n";
const char* const kInittabWithoutL0 =
    "# inittab of the test\n"
    "id:2:initdefault:\n"
    "vra0:2345:respawn:/opt/a:b --x\n";

std::string contentsOrNone(const std::string& path) {
  return pathExists(path) ? contentsOf(path) : "(none)";
}

// Everything below the directory except this file: kinds, modes, owners, contents. Not what a lock and a trace contain.
std::string stateOf(const std::string& directory, const std::string& except = "") {
  std::map<std::string, std::string> entries;
  for (auto entry = std::filesystem::recursive_directory_iterator(directory);
       entry != std::filesystem::recursive_directory_iterator(); ++entry) {
    const std::string path = entry->path().string();
    if (path == directory + "/" + except) continue;
    struct stat status = {};
    lstat(path.c_str(), &status);
    std::ostringstream text;
    text << std::oct << status.st_mode << " " << status.st_uid;
    if (S_ISREG(status.st_mode) && !path.ends_with(".lock")) {
      text << " " << withoutNonce(contentsOf(path));
    }
    entries[path] = text.str();
    if (path.ends_with("/trace")) entry.disable_recursion_pending();
  }
  std::string all;
  for (const auto& [path, text] : entries) all += path + " " + text + "\n";
  return all;
}

Words replaced(Words words, const std::string& directory) {
  for (std::string& word : words) {
    if (const size_t at = word.find('@'); at != std::string::npos) word.replace(at, 1, directory);
  }
  return words;
}

Words commandLine(const std::string& name, const Words& rest, const std::string& directory) {
  Words words = {OSUTILS_TOOL};
  std::istringstream parts(name);
  words.insert(words.end(), std::istream_iterator<std::string>(parts), {});
  const Words arguments = replaced(rest, directory);
  words.insert(words.end(), arguments.begin(), arguments.end());
  return words;
}

Words environmentAt(const std::string& directory) {
  Words environment = kEnvironment;
  environment.insert(environment.end(), {"LD_PRELOAD=" STOP_AT_MAIN, "VRA_LDAP_HOME=" + directory});
  return environment;
}

// ---- What a run may end with ----

constexpr int kSuccess = 0;
constexpr int kNo = 1;
constexpr int kFailure = 3;

std::string lastLineOf(const std::string& text) {
  const size_t end = text.empty() ? 0 : text.size() - 1;
  const size_t newline = end == 0 ? std::string::npos : text.rfind('\n', end - 1);
  return text.substr(newline == std::string::npos ? 0 : newline + 1);
}

// The call that failed may be the one that writes the message.
bool mayLackMessage(const Ended& ended) {
  return ended.struck.find("write(2, ") != std::string::npos ||
         ended.struck.find("writev(2, ") != std::string::npos;
}

std::string withoutMessage(const Ended& ended) {
  const std::string line = lastLineOf(ended.err);
  if (mayLackMessage(ended) || (line.starts_with("osutils: ") && line.ends_with('\n'))) return "";
  return "status " + std::to_string(ended.status) + " without a message: " + ended.err;
}

// The same answer with "false" for some or all of "true": the library's yes-or-no functions give no
// cause.
bool isDenied(const std::string& out, const std::string& good) {
  std::istringstream words(out);
  std::istringstream good_words(good);
  std::string word;
  for (std::string good_word; good_words >> good_word;) {
    if (!(words >> word) || (word != good_word && (good_word != "true" || word != "false"))) {
      return false;
    }
  }
  return !(words >> word);
}

// The library documents that a read error ends the services file and the inittab file.
bool mayBeShorter(const Ended& ended) { return ended.struck.starts_with("read("); }

std::string withoutDigits(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; }, '0');
  return text;
}

// ---- Commands that ask, show or change a file of their own ----

struct Command {
  const char* name;
  Words rest = {};
  int status = kSuccess;
  bool is_question = false;
  bool varies = false;      // in its digits: times
  bool is_of_list = false;  // of the services file or the inittab file
  bool has_steps = false;   // so that a failure may leave some of them done
  Words options = {};       // of the tool itself
  // An answer that is right as well after a failure.
  const char* other_answer = "";
  const char* page = "";  // a new file, which may say what it lacks
};

#ifdef OSUTILS_TRACE
// If libbabeltrace2 could not look at the stream's file when the first time was sought.
const char* const kTimedFromZero =
    R"({"displayTimeUnit":"ns","otherData":{"start":"1970-01-01T00:00:00.000000000Z"},"traceEvents":[
{"ph":"M","name":"process_name","pid":7,"tid":0,"args":{"name":"program 7 on host"}},
{"ph":"M","name":"thread_name","pid":7,"tid":7,"args":{"name":"thread 7"}},
{"ph":"X","name":"checkFilePerms","ts":0.100,"pid":7,"tid":7,"args":{"code":32,"failed":true},"dur":0.100}
]}
)";
#endif

const Command kCommands[] = {
    {.name = "help", .rest = {"file"}},
    {.name = "help", .rest = {"file"}, .options = {"--json"}},
    {.name = "services list", .rest = {"--file", "@/services"}, .is_of_list = true},
    {.name = "services list",
     .rest = {"--file", "@/services"},
     .is_of_list = true,
     .options = {"--json"}},
    {.name = "services port", .rest = {"--file", "@/services", "ssh"}},
    {.name = "services free-port", .rest = {"--file", "@/services"}, .is_of_list = true},
    {.name = "services free-port",
     .rest = {"--file", "@/services", "--unused", "3700"},
     .other_answer = "PORT\n3701\n"},
    {.name = "inittab list", .rest = {"--file", "@/inittab"}, .is_of_list = true},
    {.name = "inittab find", .rest = {"--file", "@/inittab", "/opt/a"}},
    {.name = "inittab free-id", .rest = {"--file", "@/inittab"}, .is_of_list = true},
    {.name = "paths", .rest = {}},
    {.name = "db", .rest = {}},
    {.name = "file stat", .rest = {"@/source"}},
    {.name = "file stat", .rest = {"@/missing"}, .options = {"--verbose"}},
    {.name = "file check", .rest = {"@/source"}},
    {.name = "file check", .rest = {"@/missing"}, .status = kFailure},
    {.name = "file copy", .rest = {"@/source", "@/copy"}, .has_steps = true},
    {.name = "file copy",
     .rest = {"--owner", "nobody", "--mode", "600", "@/source", "@/copy"},
     .has_steps = true},
    {.name = "file copy", .rest = {"@/source", "@/services"}, .has_steps = true},
    {.name = "file copy", .rest = {"--dry-run", "@/source", "@/copy"}},
    {.name = "file create", .rest = {"@/new"}, .has_steps = true},
    {.name = "file create", .rest = {"--force", "@/source"}, .has_steps = true},
    {.name = "file delete", .rest = {"@/source"}},
    {.name = "file clear", .rest = {"@/source"}},
    {.name = "file owner", .rest = {"@/source"}},
    {.name = "file owner",
     .rest = {"--owner", "nobody", "--group", "nogroup", "--mode", "600", "@/source"},
     .has_steps = true},
    {.name = "dir create", .rest = {"@/new"}, .has_steps = true},
    {.name = "dir delete", .rest = {"@/empty"}},
    {.name = "dir delete", .rest = {"--force", "@/full"}, .has_steps = true},
    {.name = "dir trim", .rest = {"/a/b"}},
    {.name = "space", .rest = {"1", "/tmp"}, .is_question = true},
    {.name = "space", .rest = {"99999999999999", "/tmp"}, .status = kNo, .is_question = true},
    {.name = "user exists", .rest = {"root"}, .is_question = true},
    {.name = "user exists", .rest = {"no-such-one"}, .status = kNo, .is_question = true},
    {.name = "user valid", .rest = {"root"}},
    {.name = "user home", .rest = {"root"}},
    {.name = "user group", .rest = {"root"}},
    {.name = "group exists", .rest = {"root"}, .is_question = true},
    {.name = "group members", .rest = {"root"}},
    {.name = "group has", .rest = {"root", "root"}, .is_question = true},
    {.name = "group has", .rest = {"root", "nobody"}, .status = kNo, .is_question = true},
    {.name = "name check", .rest = {"inst1"}, .is_question = true},
    {.name = "screen", .rest = {"a", "b"}, .is_question = true},
    {.name = "screen", .rest = {";"}, .status = kNo, .is_question = true},
    {.name = "time", .rest = {}, .varies = true},
    {.name = "process start", .rest = {"--launcher-dir", "@", "good"}},
    {.name = "process stop", .rest = {"2147483647"}, .status = kFailure},
    {.name = "process status",
     .rest = {"2147483647", "no-such-one"},
     .status = kNo,
     .is_question = true},
    {.name = "process status", .rest = {"1", "strace_faults"}, .is_question = true},
    {.name = "platform", .rest = {}},
    {.name = "platform", .rest = {}, .options = {"--trace", "@/trace"}},
    {.name = "module check", .rest = {"libc.so.6", "printf"}},
    {.name = "net addresses", .rest = {"--localhost"}},
    {.name = "net addresses", .rest = {"--interfaces"}},
    {.name = "net check", .rest = {"127.0.0.1"}, .is_question = true},
    {.name = "net resolve", .rest = {"localhost"}},
    {.name = "dn format", .rest = {"cn = a ; o = x"}},
    {.name = "dn compare", .rest = {"a=b", "A=B"}, .is_question = true},
    {.name = "dn compare", .rest = {"a=b", "a=c"}, .status = kNo, .is_question = true},
#ifdef OSUTILS_TRACE
    {.name = "trace summary", .rest = {"@/t"}},
    {.name = "trace tree", .rest = {"@/t"}},
    {.name = "trace export", .rest = {"--format", "chrome", "@/t"}, .other_answer = kTimedFromZero},
    {.name = "trace report", .rest = {"-o", "@/page.html", "@/t"}, .page = "page.html"},
#endif
};

void makeFiles(const std::string& directory) {
  const auto file = [&](const std::string& name, const std::string& contents, mode_t mode = 0640) {
    const std::string path = directory + "/" + name;
    writeFile(path, contents);
    (void)chmod(path.c_str(), mode);
  };
  for (const char* const made : {"etc", "empty", "full", "full/inner"}) {
    std::filesystem::create_directory(directory + "/" + made);
  }
  file("services", kServices);
  file("inittab", kInittab);
  file("source", "contents\n");
  file("full/file", "contents\n");
  file("full/inner/file", "contents\n");
  file("etc/ldapdb.properties", "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=9.1\n");
  file("vrarun", "#!/bin/sh\n[ $1 = good ]\n", 0755);
#ifdef OSUTILS_TRACE
  makeTrace(directory + "/t",
            {MadeStream(7).enter(100, kCheckFilePerms).leave(200, kCheckFilePerms, 32)});
#endif
}

std::string judgeCommand(const Command& command, const std::string& directory,
                         const std::string& before, const Ended& ended, const Ended& good,
                         const std::string& state) {
  const std::string now = stateOf(directory);
  const std::string page = directory + "/" + command.page;
  const bool has_notes = *command.page != '\0' && pathExists(page) &&
                         isPageWithNotes(contentsOf(page)) &&
                         stateOf(directory, command.page) == before;
  if (ended.status == kFailure) {
    if (const std::string lack = withoutMessage(ended); !lack.empty()) return lack;
    const bool is_old_or_new = now == before || now == state;
    return is_old_or_new || command.has_steps || has_notes ? "" : "failed, but left " + now;
  }
  if (ended.status == kSuccess && has_notes) return "";
  if (now != state) {
    return "status " + std::to_string(ended.status) + ", but left " + now;
  }
  const auto shown = [&](const std::string& out) {
    return command.varies ? withoutDigits(out) : out;
  };
  if (ended.status == good.status && shown(ended.out) == shown(good.out)) return "";
  const bool is_no = command.is_question && good.status == kSuccess && ended.status == kNo;
  if ((is_no || ended.status == good.status) && isDenied(ended.out, good.out)) return "";
  if (ended.status == kSuccess && ended.out == command.other_answer) return "";
  if (command.is_of_list && ended.status == kSuccess && mayBeShorter(ended)) return "";
  return "status " + std::to_string(ended.status) + ", out: " + ended.out + "err: " + ended.err;
}

Subject subjectOf(const Command& command, const std::string& directory) {
  Words rest = command.rest;
  std::string shown = command.name;
  Words program = commandLine(command.name, command.rest, directory);
  const Words options = replaced(command.options, directory);
#ifdef OSUTILS_TRACE
  // The program that osutils runs in its place: what fails in the loader is not what is tested.
  if (shown.starts_with("trace ")) program[0] = OSUTILS_TRACE;
#endif
  program.insert(program.begin() + 1, options.begin(), options.end());
  std::string name = "osutils";
  for (auto word = program.begin() + 1; word != program.end(); ++word) {
    name += " " + *word;
  }
  const auto before = std::make_shared<std::string>();
  return {"osutils " + std::string(command.name),
          name,
          false,
          false,
          program,
          environmentAt(directory),
          [=] {
            makeFiles(directory);
            *before = stateOf(directory);
          },
          [=] { return stateOf(directory); },
          [=](const Ended& ended, const Ended& good, const std::string& state) -> std::string {
            if (ended.struck.empty() && ended.status != command.status) {
              return "status " + std::to_string(ended.status) + " " + ended.err;
            }
            return judgeCommand(command, directory, *before, ended, good, state);
          }};
}

// ---- Commands that edit the services file or the inittab file ----

struct Family {
  const char* name;
  std::string contents;
  Words addition;
  std::string added;
  std::string deletion;
  std::string rest;
};

// One editing command on `file`.
struct Edit {
  std::string family;
  std::string verb;
  Words options;
  Words texts;
  std::string before;       // the file
  std::string copy_before;  // what an earlier edit left at the backup path; may be empty
  std::string wanted;       // the file after success
  std::string whole;        // what a copy must have that is all that is left
  std::string backup;
  bool is_dry_run = false;
};

class Editing {
 public:
  Editing(Edit edit, std::string directory, std::string scratch)
      : edit_(std::move(edit)),
        file_(directory + "/the file"),
        directory_(std::move(directory)),
        scratch_(std::move(scratch)) {
    Words rest = {"--file", file_};
    rest.insert(rest.end(), edit_.options.begin(), edit_.options.end());
    rest.insert(rest.end(), edit_.texts.begin(), edit_.texts.end());
    program_ = commandLine(edit_.family + " " + edit_.verb, rest, directory_);
    backup_ = directory_ + "/" + edit_.backup;
    next_program_ = program_;
    std::erase(next_program_, "--discard-backup");
  }

  const Words& program() const { return program_; }

  void prepare() const {
    writeFile(file_, edit_.before);
    (void)chmod(file_.c_str(), 0640);
    if (!edit_.copy_before.empty()) writeFile(backup_, edit_.copy_before);
  }

  std::string judge(const Ended& ended, const Ended& good) const {
    const std::string finding = judgeFirst(ended, good);
    if (!finding.empty() || edit_.is_dry_run) return finding;
    const auto [judged, is_new] = judged_.try_emplace(stateOf(directory_));
    if (is_new) judged->second = judgeNext();
    return judged->second;
  }

 private:
  bool hasCopy() const { return pathExists(backup_); }
  std::string described() const {
    return "file: " + contentsOrNone(file_) + "copy: " + contentsOrNone(backup_);
  }

  // What the run itself has left and said.
  std::string judgeFirst(const Ended& ended, const Ended& good) const {
    const std::string now = contentsOf(file_);
    const bool is_old = now == edit_.before;
    const bool is_new = now == edit_.wanted;
    const bool has_whole_copy = hasCopy() && contentsOf(backup_) == edit_.whole;
    const std::string got =
        "status " + std::to_string(ended.status) + ", " + ended.err + described();
    if (modeOf(file_) != 0640) return "the mode changed; " + got;
    if (edit_.is_dry_run) {
      const bool is_unchanged =
          is_old && hasCopy() == !edit_.copy_before.empty() && !pathExists(file_ + ".lock");
      if (!is_unchanged) return "a dry run changed files; " + got;
      if (ended.status == kKilled) return "";
      if (ended.status == kFailure) return withoutMessage(ended);
      return ended.status == kSuccess && ended.out == good.out ? "" : got;
    }
    if (ended.status == kKilled) {
      return is_old || is_new || has_whole_copy ? "" : "neither the old nor the new file; " + got;
    }
    if (ended.status == kSuccess) {
      const bool is_done = is_new && !hasCopy() && (ended.out == good.out);
      return is_done ? "" : "success without the complete result; " + got;
    }
    if (ended.status != kFailure) return "not a documented end; " + got;
    if (const std::string lack = withoutMessage(ended); !lack.empty()) return lack;
    const auto says = [&](const char* text) { return ended.err.find(text) != std::string::npos; };
    const bool names_copy = mayLackMessage(ended) || says(backup_.c_str());
    if (!is_old && !is_new && !(has_whole_copy && names_copy)) return "lost lines; " + got;
    if (is_new && !is_old && !mayLackMessage(ended) && !says("the change itself is done") &&
        !says(" is edited ") && !says(" is restored") && !says(" may have it ") && !names_copy) {
      return "edited, but the message does not say so; " + got;
    }
    if (hasCopy() && edit_.copy_before.empty() && !names_copy) {
      return "the message does not name the copy; " + got;
    }
    if (says(" is unchanged") && !is_old) return "not unchanged; " + got;
    if (says(" is incomplete") && !has_whole_copy) return "no complete copy; " + got;
    if ((says("the change itself is done") || says(" is edited as requested")) && !is_new) {
      return "not edited; " + got;
    }
    return "";
  }

  // The same command and what its messages recommend put things right.
  std::string judgeNext() const {
    const std::string left = described();
    const bool is_whole = [&] {
      const std::string now = contentsOf(file_);
      return now == edit_.before || now == edit_.wanted;
    }();
    std::string said;
    for (int tries = 0; tries < 4; ++tries) {
      const Ended next = run(next_program_, kEnvironment, scratch_);
      said += next.err;
      if (tries == 0 && edit_.verb != "restore" && !is_whole &&
          next.err.find(backup_) == std::string::npos) {
        return "the next run does not name the copy; " + left + said;
      }
      if (next.status == kSuccess) break;
      const std::string recommended = recommendation(next.err);
      if (recommended.empty()) break;
      const Ended repaired = run({"/bin/sh", "-c", recommended}, kEnvironment, scratch_);
      said += recommended + ": " + std::to_string(repaired.status) + " " + repaired.err;
    }
    if (contentsOf(file_) != edit_.wanted || hasCopy()) {
      return "the next run does not put things right; left " + left + "said: " + said + "now " +
             described();
    }
    if (modeOf(file_) != 0640) return "the mode is changed after the next run";
    for (const auto& entry : std::filesystem::directory_iterator(directory_)) {
      const std::string path = entry.path().string();
      if (path != file_ && path != file_ + ".lock") return "left " + path;
    }
    return "";
  }

  // The command at the end of the message, with the tool under test and --yes.
  static std::string recommendation(const std::string& message) {
    const std::string line = lastLineOf(message);
    const size_t at = line.rfind(": ");
    if (at == std::string::npos) return "";
    std::string command = line.substr(at + 2, line.size() - at - 3);
    if (command.starts_with("osutils ")) {
      return OSUTILS_TOOL + command.substr(strlen("osutils")) + " --yes";
    }
    return command.starts_with("rm ") || command.starts_with("truncate ") ||
                   command.starts_with("chmod ")
               ? command
               : "";
  }

  const Edit edit_;
  const std::string file_;
  const std::string directory_;
  const std::string scratch_;
  std::string backup_;
  Words program_;
  Words next_program_;                                 // careful with a copy
  mutable std::map<std::string, std::string> judged_;  // what judgeNext() found for what was left
};

std::vector<Edit> edits() {
  const Family families[] = {
      {"services", kServices, {"new", "4000"}, "new\t4000/tcp\n", "domain", kServicesWithoutDomain},
      {"inittab", kInittab, {"new", "2", "wait", "/x"}, "new:2:wait:/x\n", "l0", kInittabWithoutL0},
  };
  std::vector<Edit> edits;
  for (const Family& family : families) {
    const std::string damaged = family.contents.substr(0, 30);
    const std::string added = family.contents + family.added;
    const std::string usual = "the file.vrasave";
    for (const Words& options : {Words{}, Words{"--no-lock"}, Words{"--backup", "@/copy"},
                                 Words{"--discard-backup"}, Words{"--dry-run"}}) {
      const std::string option = options.empty() ? "" : options[0];
      const std::string backup = option == "--backup" ? "copy" : usual;
      const std::string copy = option == "--discard-backup" ? damaged : "";
      const bool is_dry_run = option == "--dry-run";
      edits.push_back({family.name, "add", options, family.addition, family.contents, copy, added,
                       family.contents, backup, is_dry_run});
      edits.push_back({family.name,
                       "delete",
                       options,
                       {family.deletion},
                       family.contents,
                       copy,
                       family.rest,
                       family.contents,
                       backup,
                       is_dry_run});
      if (option == "--discard-backup") continue;
      Words with_yes = options;
      if (!is_dry_run) with_yes.push_back("--yes");
      edits.push_back({family.name,
                       "restore",
                       with_yes,
                       {},
                       damaged,
                       family.contents,
                       family.contents,
                       family.contents,
                       backup,
                       is_dry_run});
    }
    // The file has all of the copy.
    edits.push_back({family.name,
                     "restore",
                     {"--yes"},
                     {},
                     family.contents,
                     family.contents,
                     family.contents,
                     family.contents,
                     usual,
                     false});
  }
  return edits;
}

Subject subjectOf(const Edit& edit, const std::string& directory, const std::string& scratch) {
  const auto editing = std::make_shared<Editing>(edit, directory, scratch);
  std::string name = "osutils " + edit.family + " " + edit.verb;
  const std::string row = name;
  for (const std::string& option : edit.options) name += " " + option;
  if (edit.before == edit.copy_before) name += " (complete file)";
  return {row,
          name,
          true,
          false,
          editing->program(),
          environmentAt(directory),
          [=] { editing->prepare(); },
          [=] { return stateOf(directory); },
          [=](const Ended& ended, const Ended& good, const std::string&) {
            return editing->judge(ended, good);
          }};
}

// The first words of the lines below "Subcommands:".
Words commandsIn(const std::string& help) {
  Words names;
  std::istringstream lines(help.substr(std::min(help.find("Subcommands:\n"), help.size())));
  for (std::string line; std::getline(lines, line) && !line.empty();) {
    if (line.starts_with("  ") && line[2] != ' ') {
      names.push_back(line.substr(2, line.find(' ', 2) - 2));
    }
  }
  return names;
}

}  // namespace

std::vector<Subject> commandSubjects(const std::string& directory, const std::string& scratch) {
  std::vector<Subject> subjects;
  for (const Edit& edit : edits()) subjects.push_back(subjectOf(edit, directory, scratch));
  for (const Command& command : kCommands) subjects.push_back(subjectOf(command, directory));
  return subjects;
}

Words commandsWithoutSubject(const std::vector<Subject>& subjects, const std::string& scratch) {
  Words missing;
  const auto require = [&](const std::string& name) {
    if (std::none_of(subjects.begin(), subjects.end(),
                     [&](const Subject& each) { return each.row == "osutils " + name; })) {
      missing.push_back(name);
    }
  };
  const Words families = commandsIn(run({OSUTILS_TOOL, "help"}, kEnvironment, scratch).out);
  if (families.empty()) missing.emplace_back("(osutils help names no command)");
  for (const std::string& family : families) {
    const Words commands =
        commandsIn(run({OSUTILS_TOOL, "help", family}, kEnvironment, scratch).out);
    if (commands.empty()) require(family);
    for (const std::string& command : commands) require(family + " " + command);
  }
  return missing;
}
