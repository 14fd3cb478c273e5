#include "scenario.h"

#include <errno.h>
#include <grp.h>
#include <linux/magic.h>
#include <pwd.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <list>
#include <stdexcept>
#include <utility>

namespace scenarios {
namespace {

std::string directory_of_run;

// A symbol ends with "*" where its rest depends on the architecture.
bool isSameSymbol(const std::string& pattern, const std::string& symbol) {
  return pattern.ends_with('*') ? symbol.starts_with(pattern.substr(0, pattern.size() - 1))
                                : pattern == symbol;
}

std::vector<std::string> exportedFunctions() {
  std::vector<std::string> functions;
  std::ifstream list(EXPORTED_SYMBOLS);
  for (std::string line; std::getline(list, line);) {
    const std::string kind = "function ";
    if (line.starts_with(kind)) functions.push_back(line.substr(kind.size()));
  }
  return functions;
}

std::string inOctal(unsigned int number) {
  char text[16];
  snprintf(text, sizeof text, "%o", number);
  return text;
}

}  // namespace

Expected::Expected(std::string text)
    : matches_([text = std::move(text)](const std::string& other) { return text == other; }) {}

std::vector<Scenario> all() {
  std::vector<Scenario> scenarios;
  for (const auto& family :
       {accountScenarios, directoryScenarios, environmentScenarios, fileScenarios, hostScenarios,
        inittabScenarios, libraryScenarios, nameScenarios, networkScenarios, processScenarios,
        servicesScenarios, traceScenarios}) {
    std::vector<Scenario> own = family();
    std::move(own.begin(), own.end(), std::back_inserter(scenarios));
  }
  return scenarios;
}

std::vector<std::string> symbolsWithoutScenario(const std::vector<Scenario>& scenarios) {
  std::vector<std::string> missing = exportedFunctions();
  for (const Scenario& scenario : scenarios) {
    for (const std::string& symbol : scenario.symbols) {
      std::erase_if(missing, [&](const std::string& each) { return isSameSymbol(symbol, each); });
    }
  }
  return missing;
}

std::vector<std::string> unknownSymbols(const std::vector<Scenario>& scenarios) {
  const std::vector<std::string> functions = exportedFunctions();
  std::vector<std::string> unknown;
  for (const Scenario& scenario : scenarios) {
    std::copy_if(scenario.symbols.begin(), scenario.symbols.end(), std::back_inserter(unknown),
                 [&](const std::string& symbol) {
                   return std::none_of(
                       functions.begin(), functions.end(),
                       [&](const std::string& each) { return isSameSymbol(symbol, each); });
                 });
  }
  return unknown;
}

void setDirectory(const std::string& directory) { directory_of_run = directory; }

char* path(const std::string& name) {
  static std::list<std::string> paths;
  return paths.emplace_back(directory_of_run + "/" + name).data();
}

std::string etcFile(const std::string& name) {
  struct statfs file_system;
  struct stat etc;
  struct stat root;
  if (statfs("/etc", &file_system) != 0 || stat("/etc", &etc) != 0 || stat("/", &root) != 0 ||
      file_system.f_type != TMPFS_MAGIC || etc.st_dev == root.st_dev) {
    throw std::runtime_error("/etc is not a private copy");
  }
  return "/etc/" + name;
}

std::string text(const Left& left) {
  return std::to_string(left.blocks) + " blocks, " + std::to_string(left.descriptors) +
         " descriptors";
}

std::string judge(const Scenario& scenario, Kinds failed, const Outcome& outcome) {
  const std::string got =
      "result " + outcome.result + (outcome.state.empty() ? "" : ", state " + outcome.state);
  const Left* required = nullptr;
  for (const End& end : scenario.ends) {
    // Of several kinds it is unknown which ones failed.
    const bool is_single = (failed & (failed - 1)) == 0;
    const bool is_good =
        &end == &scenario.ends.front() && !(is_single && (failed & scenario.reported) != 0);
    const bool is_allowed = is_good || (end.after & failed) != 0;
    if (!is_allowed || !end.result.matches(outcome.result) || !end.state.matches(outcome.state)) {
      continue;
    }
    if (!outcome.left || end.left == *outcome.left) return "";
    required = &end.left;
  }
  if (required == nullptr) return got;
  return got + ": left " + text(*outcome.left) + ", not " + text(*required);
}

void alwaysReports(std::vector<Scenario>& all, const std::string& symbol, Kinds kinds) {
  for (Scenario& scenario : all) {
    if (scenario.symbols.front() != symbol) continue;
    for (size_t i = 1; i < scenario.ends.size(); ++i) {
      scenario.reported |= scenario.ends[i].after & kinds;
    }
  }
}

std::string freed(char* text) {
  if (text == nullptr) return "null";
  std::string shown = "\"" + std::string(text) + "\"";
  free(text);
  return shown;
}

std::string freed(char** list) {
  if (list == nullptr) return "null";
  std::string shown = "(";
  for (char** each = list; *each != nullptr; ++each) {
    shown += (each == list ? "" : " ") + freed(*each);
  }
  free(static_cast<void*>(list));
  return shown + ")";
}

std::function<std::vector<std::string>()> written;
std::function<void()> instead_of_waiting;

namespace {

std::string joined(const std::vector<std::string>& texts) {
  std::string all;
  for (const std::string& text : texts) all += (all.empty() ? "" : "|") + text;
  return "(" + all + ")";
}

}  // namespace

std::string shownWritten() { return written ? joined(written()) : "unseen"; }

Expected writes(std::vector<std::string> texts) {
  return Expected(
      [all = joined(texts)](const std::string& seen) { return seen == all || seen == "unseen"; });
}

std::string shown(bool value) { return value ? "true" : "false"; }
std::string shown(int value) { return std::to_string(value); }

std::string shownOwned(const std::string& name) {
  struct stat status;
  if (lstat(path(name), &status) != 0) return shownFile(name);
  const passwd* const user = getpwuid(status.st_uid);
  std::string shown = user != nullptr ? user->pw_name : std::to_string(status.st_uid);
  const group* const group = getgrgid(status.st_gid);
  shown += ":" + (group != nullptr ? group->gr_name : std::to_string(status.st_gid)) + " ";
  if (S_ISDIR(status.st_mode)) shown += inOctal(status.st_mode & 07777U) + " ";
  return shown + shownFile(name);
}

void makeFile(const std::string& name, const std::string& contents, unsigned int mode) {
  std::ofstream(path(name), std::ios::binary) << contents;
  chmod(path(name), mode);
}

std::string withUmask(const std::function<std::string()>& call) {
  const mode_t before = umask(022);
  const std::string result = call();
  return result + ", umask " + inOctal(umask(before));
}

std::string shownFile(const std::string& name) {
  const char* const file = path(name);
  struct stat status;
  if (lstat(file, &status) != 0) return errno == ENOENT ? "missing" : strerror(errno);
  if (S_ISDIR(status.st_mode)) return "directory";
  if (S_ISLNK(status.st_mode)) return "-> " + std::filesystem::read_symlink(file).string();
  std::ifstream in(file, std::ios::binary);
  return inOctal(status.st_mode & 07777U) + " " +
         std::string(std::istreambuf_iterator<char>(in), {});
}

}  // namespace scenarios
