#include "tool_scenarios.h"

#include <fcntl.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <utility>

#include "made_trace.h"
#include "report_page.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using Words = std::vector<std::string>;
using Prepare = std::function<void(World&)>;

Prepare file(const std::string& name, const std::string& contents, mode_t mode = 0644) {
  return [=](World& world) {
    const std::string path = world.directory + "/" + name;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    writeFile(path, contents);
    (void)chmod(path.c_str(), mode);
  };
}

Prepare directory(const std::string& name) {
  return [=](World& world) { std::filesystem::create_directories(world.directory + "/" + name); };
}

Prepare both(const Prepare& first, const Prepare& second) {
  return [=](World& world) {
    first(world);
    second(world);
  };
}

// ---- Edits ----

struct Family {
  std::string name;
  std::string contents;
  Words addition;
  std::string deleted;
};

const Family kEdited[] = {
    {"services", kServices, {"new", "4000"}, "domain"},
    {"inittab", kInittab, {"new", "2", "wait", "/x"}, "l0"},
};

// The file is as before or as after the edit, or the message names a complete copy. A copy that is
// left is named in any case.
bool isAsDocumented(const std::map<std::string, std::string>& state, const std::string& message,
                    const std::string& contents, const std::string& edited) {
  const auto endsWith = [&](const std::string& name, const std::string& text) {
    const auto found = state.find(name);
    return found != state.end() && found->second.substr(found->second.find(' ', 7) + 1) == text;
  };
  const bool is_copy_left = state.contains("f.vrasave");
  if (is_copy_left && message.find("f.vrasave") == std::string::npos) return false;
  for (const auto& [name, what] : state) {
    if (name != "f" && name != "f.vrasave") return false;
  }
  return endsWith("f", contents) || endsWith("f", edited) || endsWith("f.vrasave", contents);
}

std::string without(const std::string& contents, const std::string& name) {
  std::string rest;
  for (size_t at = 0; at < contents.size();) {
    const size_t end = contents.find('\n', at) + 1;
    const std::string line = contents.substr(at, end - at);
    if (!line.starts_with(name + ":") && !line.starts_with(name + " ")) rest += line;
    at = end;
  }
  return rest;
}

// Another process that holds the lock for a moment.
void holdLock(World& world) {
  const std::string lock = world.directory + "/f.lock";
  const int descriptor = open(lock.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  int ready[2];
  if (pipe2(ready, O_CLOEXEC) != 0) return;
  const pid_t child = fork();
  if (child == 0) {
    struct flock whole = {};
    whole.l_type = F_WRLCK;
    (void)fcntl(descriptor, F_SETLK, &whole);
    (void)!write(ready[1], "", 1);
    const timespec moment = {0, 30'000'000};
    nanosleep(&moment, nullptr);
    _exit(0);
  }
  close(descriptor);
  close(ready[1]);
  char done = 0;
  (void)!read(ready[0], &done, 1);
  close(ready[0]);
}

// The tool edits both files with the same code: the options are failed with one of them.
bool needsNoOption(const ToolScenario& scenario) {
  const Words plain = {
      "", "--yes", "of nothing", "of what is there", "of what is missing", "of a missing file"};
  return std::find(plain.begin(), plain.end(), scenario.variant) != plain.end();
}

void addEdits(std::vector<ToolScenario>& list, const Family& family) {
  const Prepare plain = file("f", family.contents);
  const std::string rest = without(family.contents, family.deleted);
  const auto add = [&](const std::string& command, const std::string& variant, const Words& options,
                       const Words& texts, const Prepare& prepare = {},
                       int status = 0) -> ToolScenario& {
    ToolScenario scenario;
    scenario.command = family.name + " " + command;
    scenario.variant = variant;
    scenario.words = {family.name, command, "--file", "@/f"};
    scenario.words.insert(scenario.words.end(), options.begin(), options.end());
    scenario.words.insert(scenario.words.end(), texts.begin(), texts.end());
    scenario.prepare = prepare ? prepare : plain;
    scenario.status = status;
    list.push_back(scenario);
    return list.back();
  };
  const auto edit = [&](const std::string& command, const std::string& variant,
                        const Words& options, const Prepare& prepare = {},
                        int status = 0) -> ToolScenario& {
    const Words texts = command == "add"      ? family.addition
                        : command == "delete" ? Words{family.deleted}
                                              : Words{};
    ToolScenario& scenario = add(command, variant, options, texts, prepare, status);
    scenario.may_leave = [contents = family.contents, rest](const auto& state,
                                                            const std::string& message) {
      return isAsDocumented(state, message, contents, rest);
    };
    scenario.repair = {{family.name, "restore", "--yes", "--file", "@/f"}};
    return scenario;
  };

  // The library takes a read error for the end of the file. For services the tool reads the file too.
  const scenarios::Kinds shortens =
      family.name == "inittab" ? scenarios::kRead : scenarios::kNothing;
  add("list", "", {}, {}).may_mislead = shortens;
  add("list", "--json", {"--json"}, {}).may_mislead = shortens;
  add(
      "list", "of a missing file", {}, {}, [](World&) {}, 3);
  edit("add", "", {});
  edit("add", "--no-lock", {"--no-lock"});
  edit("add", "--dry-run", {"--dry-run"});
  edit("add", "--json", {"--json"});
  edit("add", "--discard-backup", {"--discard-backup"}, both(plain, file("f.vrasave", "left")));
  edit("add", "beside a copy", {}, both(plain, file("f.vrasave", "left")), 3);
  edit("add", "of what is there", {},
       file("f", family.contents + family.addition[0] +
                     (family.name == "services" ? "\t4000/tcp\n" : ":2:wait:/x\n")),
       3);
  if (family.name == "services") {
    edit("add", "of an alias", {},
         file("f", family.contents + "other 4001/tcp another-alias-of-it new\n"), 3);
    edit("add", "of a taken port", {}, file("f", family.contents + "other 4000/tcp\n"), 3);
    edit("add", "--force of what is there", {"--force"},
         file("f", family.contents + "new 4001/tcp\n"), 3);
  }
  edit("add", "after waiting", {}, both(plain, holdLock)).is_verbose = true;
  edit("delete", "", {});
  edit("delete", "--no-lock", {"--no-lock"});
  edit("delete", "--dry-run", {"--dry-run"});
  edit("delete", "--discard-backup", {"--discard-backup"}, both(plain, file("f.vrasave", "left")));
  edit("delete", "beside a copy", {}, both(plain, file("f.vrasave", "left")), 3);
  edit("delete", "of what is missing", {}, file("f", rest), 3);
  edit("delete", "after waiting", {}, both(plain, holdLock)).is_verbose = true;
  edit("restore", "--yes", {"--yes"},
       both(file("f", family.contents.substr(0, 30)), file("f.vrasave", family.contents)));
  edit("restore", "--yes of a missing file", {"--yes"}, file("f.vrasave", family.contents));
  edit("restore", "--yes --no-lock", {"--yes", "--no-lock"},
       both(file("f", family.contents.substr(0, 30)), file("f.vrasave", family.contents)));
  edit("restore", "--yes of a beginning", {"--yes"},
       both(plain, file("f.vrasave", family.contents.substr(0, 30))));
  edit("restore", "--dry-run", {"--dry-run"},
       both(file("f", family.contents.substr(0, 30)), file("f.vrasave", family.contents)));
  edit("restore", "without a copy", {"--yes"}, {}, 3);
  edit("restore", "without a terminal", {},
       both(file("f", family.contents.substr(0, 30)), file("f.vrasave", family.contents)), 2);

  // With a backup path of their own.
  for (const std::string command : {"add", "delete"}) {
    ToolScenario& other = edit(command, "--backup", {"--backup", "@/other"});
    other.may_leave = [contents = family.contents, rest](auto state, const std::string& message) {
      if (state.contains("other")) {
        if (message.find("/other") == std::string::npos) return false;
        state["f.vrasave"] = state["other"];
        state.erase("other");
      }
      return isAsDocumented(state, message + "f.vrasave", contents, rest);
    };
    other.repair = {{family.name, "restore", "--yes", "--file", "@/f", "--backup", "@/other"}};
  }
}

// ---- Files ----

void addFiles(std::vector<ToolScenario>& list) {
  const Prepare f = file("f", "text\n", 0600);
  const auto add = [&](const std::string& command, const std::string& variant, const Words& rest,
                       const Prepare& prepare, int status = 0) -> ToolScenario& {
    ToolScenario scenario;
    scenario.command = command;
    scenario.variant = variant;
    const size_t blank = command.find(' ');
    scenario.words = {command.substr(0, blank)};
    if (blank != std::string::npos) scenario.words.push_back(command.substr(blank + 1));
    scenario.words.insert(scenario.words.end(), rest.begin(), rest.end());
    scenario.prepare = prepare;
    scenario.status = status;
    list.push_back(scenario);
    return list.back();
  };
  const Words accounts = {"--owner", "nobody", "--group", "root", "--mode", "604"};
  const auto with = [](Words options, const Words& rest) {
    options.insert(options.end(), rest.begin(), rest.end());
    return options;
  };

  // What cannot be examined counts as missing.
  add("file stat", "", {"@/f"}, f).may_mislead = scenarios::kStatus | scenarios::kOpen;
  add("file stat", "of nothing", {"--json", "@/f"}, [](World&) {}).may_mislead =
      scenarios::kStatus | scenarios::kOpen;
  add("file check", "", {"@/f"}, f);
  add(
      "file check", "of nothing", {"@/f"}, [](World&) {}, 3);
  // The destination may be left without the text, or with a part of it.
  const auto keepsSource = [](const std::map<std::string, std::string>& state, const std::string&) {
    return state.size() == 2 && state.contains("new") && state.at("f").ends_with("text\n");
  };
  for (const bool has_accounts : {false, true}) {
    ToolScenario& copy =
        add("file copy", has_accounts ? "with accounts" : "",
            has_accounts ? with(accounts, {"@/f", "@/new"}) : Words{"@/f", "@/new"}, f);
    copy.may_leave = keepsSource;
    copy.repair = {{"file", "delete", "@/new"}};  // a destination that is there keeps its mode
  }
  ToolScenario& onto =
      add("file copy", "onto a file", {"@/f", "@/new"}, both(f, file("new", "older text\n", 0640)));
  onto.may_leave = keepsSource;
  onto.may_mislead = scenarios::kStatus;  // whether the destination was there
  add("file copy", "--dry-run", {"--dry-run", "@/f", "@/new"}, f);
  add(
      "file copy", "of nothing", {"@/f", "@/new"}, [](World&) {}, 3);
  // A new file may be left without its owner, group and mode.
  const auto isEmptyOrMissing = [](const std::map<std::string, std::string>& state,
                                   const std::string&) {
    return state.empty() ||
           (state.size() == 1 && state.contains("new") && state.at("new").ends_with(' '));
  };
  for (const bool has_accounts : {false, true}) {
    ToolScenario& creation =
        add("file create", has_accounts ? "with accounts" : "",
            has_accounts ? with(accounts, {"@/new"}) : Words{"@/new"}, [](World&) {});
    creation.may_leave = isEmptyOrMissing;
    creation.repair = {{"file", "delete", "@/new"}};
  }
  // The old file is removed first.
  add("file create", "--force", {"--force", "@/f"}, f).may_leave =
      [](const std::map<std::string, std::string>& state, const std::string&) {
        return state.empty() || (state.size() == 1 && state.contains("f"));
      };
  add("file create", "--dry-run", {"--dry-run", "@/new"}, [](World&) {});
  add("file create", "of what is there", {"@/f"}, f, 3);
  add("file delete", "", {"@/f"}, f);
  add("file delete", "--dry-run", {"--dry-run", "@/f"}, f);
  add(
      "file delete", "of nothing", {"@/f"}, [](World&) {}, 3);
  add("file clear", "", {"@/f"}, f);
  add("file clear", "of nothing", {"@/f"}, [](World&) {});
  add("file clear", "--dry-run", {"--dry-run", "@/f"}, f);
  add("file owner", "", {"@/f"}, f);
  // The three are set one after the other.
  add("file owner", "with accounts", with(accounts, {"@/f"}), f).may_leave =
      [](const std::map<std::string, std::string>& state, const std::string&) {
        return state.size() == 1 && state.contains("f") && state.at("f").ends_with(" text\n");
      };
  add("file owner", "--mode", {"--mode", "640", "@/f"}, f);
  add("file owner", "--dry-run", with(accounts, {"--dry-run", "@/f"}), f);

  const auto isDirectoryOrMissing = [](const std::map<std::string, std::string>& state,
                                       const std::string&) {
    return state.empty() || (state.size() == 1 && state.contains("new"));
  };
  for (const bool has_accounts : {false, true}) {
    ToolScenario& creation =
        add("dir create", has_accounts ? "with accounts" : "",
            has_accounts ? with(accounts, {"@/new"}) : Words{"@/new"}, [](World&) {});
    creation.may_leave = isDirectoryOrMissing;
    creation.repair = {{"dir", "delete", "@/new"}};
  }
  add("dir create", "--dry-run", {"--dry-run", "@/new"}, [](World&) {});
  add("dir delete", "", {"@/d"}, directory("d"));
  add("dir delete", "--force", {"--force", "@/d"},
      both(file("d/f", "text\n"), file("d/e/f", "text\n")));
  add("dir delete", "--dry-run", {"--dry-run", "@/d"}, directory("d"));
  add("dir delete", "--dry-run --force", {"--dry-run", "--force", "@/d"},
      both(file("d/f", "text\n"), file("d/e/f", "text\n")));
  add("dir delete", "of a full one", {"@/d"}, file("d/f", "text\n"), 3);
  add("dir trim", "", {"a/b/c"}, [](World&) {});
  // What cannot be asked counts as no.
  add("space", "yes", {"1", "@"}, [](World&) {}).may_mislead =
      scenarios::kStatus | scenarios::kPrint;
  add(
      "space", "no", {"999999999", "@"}, [](World&) {}, 1);
}

// ---- All others ----

void addOthers(std::vector<ToolScenario>& list) {
  const auto add = [&](const std::string& command, const std::string& variant,
                       const Words& rest = {}, int status = 0) -> ToolScenario& {
    ToolScenario scenario;
    scenario.command = command;
    scenario.variant = variant;
    const size_t blank = command.find(' ');
    scenario.words = {command.substr(0, blank)};
    if (blank != std::string::npos) scenario.words.push_back(command.substr(blank + 1));
    scenario.words.insert(scenario.words.end(), rest.begin(), rest.end());
    scenario.status = status;
    list.push_back(scenario);
    return list.back();
  };

  add("help", "").has_common_calls = true;
  add("help", "services add", {"services", "add"});
  add("help", "--json", {"--json", "group", "has"});
  add("help", "of nothing", {"nothing"}, 2);
  add("services port", "", {"--file", "@/f", "ldap"}).prepare = file("f", kServices);
  add("services port", "of nothing", {"--file", "@/f", "x"}, 3).prepare = file("f", kServices);
  add("services add", "--force", {"--force", "--file", "@/f", "a#b", "70000"}).prepare =
      file("f", kServices);
  add("services free-port", "", {"--file", "@/f"}).prepare = file("f", kServices);
  ToolScenario& unused =
      add("services free-port", "--unused", {"--unused", "--file", "@/f", "389"});
  unused.prepare = file("f", kServices);
  // A later port after a failure of the network. The library takes a read error for the end of the file.
  unused.may_mislead = scenarios::kNetwork | scenarios::kRead;
  add("inittab find", "", {"--file", "@/f", "/opt"}).prepare = file("f", kInittab);
  add("inittab find", "of nothing", {"--file", "@/f", "nothing"}, 3).prepare = file("f", kInittab);
  ToolScenario& free_id = add("inittab free-id", "", {"--file", "@/f"});
  free_id.prepare = file("f", kInittab);
  // The next id. The library takes a read error for the end of the file.
  free_id.may_mislead = scenarios::kPrint | scenarios::kRead;

  const std::string properties = "currentXQ4Version=9.1\ncurrentXQ4InstallPath=/opt/db/\n";
  const Words root = {"VRA_LDAP_HOME=@"};
  const auto atRoot = [&](ToolScenario& scenario, const Prepare& prepare) {
    scenario.environment = root;
    scenario.prepare = prepare;
    // What cannot be examined counts as missing.
    if (scenario.command == "paths") scenario.may_mislead = scenarios::kStatus;
  };
  atRoot(add("paths", ""), file("lib64/libvradbutils.so", ""));
  atRoot(add("paths", "--schema", {"--json", "--schema", "7"}), directory("sbin"));
  atRoot(add("db", ""), file("etc/ldapdb.properties", properties));
  atRoot(add("db", "with an invalid version", {}, 3),
         file("etc/ldapdb.properties", "currentXQ4Version=x\ncurrentXQ4InstallPath=/opt/db/\n"));
  atRoot(add("db", "of nothing", {}, 3), [](World&) {});
  add("db", "--instance", {"--instance", "a", "--location", "@"}).prepare =
      file("vraslapd-a/etc/ldapdb.properties", properties);
  add("db", "--migration", {"--migration", "@"}).prepare = file("etc/xq4info", properties);

  add("user exists", "yes", {"root"});
  add("user exists", "no", {"nosuchuser"}, 1);
  add("user exists", "--verbose", {"--verbose", "nosuchuser"}, 1).is_verbose = true;
  add("user valid", "", {"root"});
  add("user valid", "of nobody", {"nosuchuser"}, 3);
  add("user home", "", {"root"});
  add("user home", "of nobody", {"nosuchuser"}, 3);
  add("user group", "", {"root"});
  add("group exists", "yes", {"root"});
  add("group exists", "no", {"nosuchgroup"}, 1);
  add("group members", "", {"root"});
  add("group has", "yes", {"root", "root"});
  add("group has", "no", {"root", "nobody"}, 1);
  add("name check", "yes", {"a"});
  add("name check", "no", {"a b"}, 1);
  add("screen", "yes", {"a", "b"});
  add("screen", "no", {"a;b"}, 1);
  add("time", "").has_varying_numbers = true;
  add("time", "--compact", {"--compact"}).has_varying_numbers = true;
  // One command is enough: all start tracing in the same way.
  add("time", "--trace", {"--trace", "@/trace"}).has_varying_numbers = true;

  const Prepare install = [](World& world) {
    std::filesystem::create_symlink("/proc/" + std::to_string(getpid()) + "/exe",
                                    world.directory + "/vrarun");
  };
  add("process start", "", {"--launcher-dir", "@", "a", "b"}).prepare = install;
  add("process start", "--dry-run", {"--dry-run", "--launcher-dir", "@", "a"}).prepare = install;
  add("process start", "of nothing", {"--launcher-dir", "@", "a"}, 3);
  const Prepare sleeper = [](World& world) {
    const pid_t child = fork();
    if (child == 0) {
      for (;;) pause();
    }
    world.processes.push_back(child);
  };
  for (const Words& words : {Words{}, Words{"--dry-run"}}) {
    Words rest = words;
    rest.push_back("PID");
    ToolScenario& stop = add("process stop", words.empty() ? "" : "--dry-run", rest);
    stop.prepare = sleeper;
    stop.has_varying_numbers = true;
    stop.ends_process = words.empty();
  }
  add("process stop", "of nothing", {"2000000000"}, 3);
  ToolScenario& status = add("process status", "yes", {"PID", "tool_faults"});
  status.prepare = sleeper;
  status.has_varying_numbers = true;
  status.may_mislead =
      scenarios::kProcess | scenarios::kPrint;  // what cannot be asked counts as no
  add("process status", "no", {"2000000000", "tool_faults"}, 1);

#ifdef OSUTILS_TRACE
  const Prepare traced = [](World& world) {
    MadeStream stream(7);
    stream.enter(100, kCheckFilePerms)
        .message(110, kCheckFilePerms, "text")
        .leave(200, kCheckFilePerms, 32);
    makeTrace(world.directory + "/t", {stream});
  };
  add("trace summary", "", {"@/t"}).prepare = traced;
  add("trace summary", "--json", {"--json", "--by", "thread", "@/t"}).prepare = traced;
  ToolScenario& cut = add("trace summary", "of a file that is cut", {"@/t"}, 3);
  cut.prepare = [traced](World& world) {
    traced(world);
    writeFile(world.directory + "/t/stream-0", std::string(30, 'x'));
  };
  cut.environment = {"TMPDIR=@"};
  cut.may_mislead = scenarios::kDirectory;  // what cannot be removed stays there
  add("trace tree", "", {"@/t"}).prepare = traced;
  add("trace tree", "--json", {"--json", "--only-failed", "@/t"}).prepare = traced;
  add("trace tree", "of nothing", {"@/t"}, 3);
  add("trace summary", "of nothing", {"@/t"}, 3);
  for (const char* const format : {"chrome", "folded", "jsonl"}) {
    add("trace export", format, {"--format", format, "@/t"}).prepare = traced;
  }
  for (const bool is_forced : {false, true}) {
    ToolScenario& report = add("trace report", is_forced ? "--force" : "",
                               is_forced ? Words{"--force", "-o", "@/page.html", "@/t"}
                                         : Words{"-o", "@/page.html", "@/t"});
    report.prepare = is_forced ? both(traced, file("page.html", "older page")) : traced;
    // The trace is read twice: what is missing the second time is missing in the page. If everything fails from the
    // moment on at which a page is to be replaced, the new one stays under its temporary name.
    report.may_leave = [](const std::map<std::string, std::string>& state, const std::string&) {
      const auto page = state.find("page.html");
      if (state.size() == 4 && page != state.end()) return isPageWithNotes(page->second);
      return state.size() == 5 && page != state.end() && page->second.ends_with("older page") &&
             state.begin()->first.starts_with(".page.html.") && isPage(state.begin()->second);
    };
    if (!is_forced) report.repair = {{"file", "delete", "@/page.html"}};
  }
  add("trace report", "--dry-run", {"--dry-run", "-o", "@/page.html", "@/t"}).prepare = traced;
  add("trace report", "onto a page", {"-o", "@/page.html", "@/t"}, 3).prepare =
      both(traced, file("page.html", "older page"));
  add("trace report", "of nothing", {"-o", "@/page.html", "@/t"}, 3);
  add("trace export", "of nothing", {"--format", "chrome", "@/t"}, 3);
#endif

  // What isNPTL returns if it cannot look is false.
  add("platform", "").may_mislead = scenarios::kRead | scenarios::kProcess | scenarios::kOpen;
  add("module check", "", {"libc.so.6", "malloc"});
  add("module check", "without a symbol", {"libc.so.6"});
  add("module check", "of nothing", {"@/nothing.so"}, 3);
  add("module check", "of a missing symbol", {"libc.so.6", "nosuchsymbol"}, 3);

  add("net addresses", "");
  add("net addresses", "--localhost", {"--localhost"});
  add("net addresses", "--interfaces", {"--interfaces"});
  add("net check", "yes", {"127.0.0.1"});
  // The library prints a line if it cannot list the interfaces.
  add("net check", "no", {"192.0.2.1"}, 1).may_mislead = scenarios::kNetwork;
  add("net resolve", "", {"localhost"});
  add("net resolve", "of nothing", {"nothing.invalid"}, 3);

  add("dn format", "", {"cn = Ann ,o=b"});
  add("dn format", "of the input", {"--json"}).input = "a = b\nc=d;e=f\n";
  add("dn format", "of a blank line", {}, 3).input = "a = b\n\nc=d\n";
  // The library takes a name for which memory is missing for another one.
  add("dn compare", "yes", {"a=b", "A = b"}).may_mislead = scenarios::kMemory;
  add("dn compare", "no", {"a=b", "a=c"}, 1);
  ToolScenario& compared = add("dn compare", "of the input");
  compared.input = "a = b\nA=b\n";
  compared.may_mislead = scenarios::kMemory;
}

}  // namespace

std::vector<ToolScenario> toolScenarios() {
  std::vector<ToolScenario> list;
  addOthers(list);  // with the longest
  for (const Family& family : kEdited) addEdits(list, family);
  std::erase_if(list, [](const ToolScenario& scenario) {
    return scenario.words.front() == "inittab" && !needsNoOption(scenario);
  });
  addFiles(list);
  return list;
}

int launcher(int count, char** arguments) {
  std::string text;
  for (int i = 1; i < count; ++i) text += std::string(arguments[i]) + "\n";
  for (int descriptor = 0; descriptor < 1024; ++descriptor) {
    if (fcntl(descriptor, F_GETFD) != -1) text += std::to_string(descriptor) + " ";
  }
  writeFile("started", text + "\n");
  return 0;
}
