// The file, dir and space commands.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <memory>

#include "command.h"

namespace files {
namespace {

constexpr unsigned int kMaxMode = 07777;
constexpr unsigned int kNewFileMode = 0640;
constexpr unsigned int kNewDirectoryMode = 0750;

struct Options {
  std::string path;
  std::string destination;
  std::string mebibytes;
  std::optional<std::string> owner;
  std::optional<std::string> group;
  std::optional<std::string> mode;
  bool force = false;
};

char* orNull(std::optional<std::string>& text) { return text ? text->data() : nullptr; }

std::string octal(unsigned int mode) {
  char text[16];
  (void)snprintf(text, sizeof text, "%04o", mode);
  return text;
}

unsigned int modeFrom(const std::string& text, const char* argument) {
  return numberFrom<unsigned int>(text, argument, "an octal mode from 0 to 7777", 8, 0, kMaxMode);
}

unsigned int modeOr(const Options& options, unsigned int otherwise) {
  return options.mode ? modeFrom(*options.mode, "--mode") : otherwise;
}

// Called first: createFile removes the old file before it looks up the accounts.
void requireAccounts(const Options& options) {
  if (options.owner) requireUser(*options.owner);
  if (options.group) requireGroup(*options.group);
}

Answer ownership(const std::string& path) {
  const auto owners = osutils::getFileOwnersAndPermissions(path);
  if (!owners) {
    throw Failure("cannot determine the owner and group of " + path, path);
  }
  return {{"path", path},
          {"owner", orNoMemory(owners->owner)},
          {"group", orNoMemory(owners->group)},
          {"mode", octal(owners->mode & kMaxMode)}};
}

// Returns the ownership after a change, or fails if it is not what was requested: the library
// tolerates a refused change of owner, and the system drops mode bits that the user may not set.
// Accounts are compared by number because they may have several names.
Answer ownershipAsAsked(const Options& options, unsigned int mode) {
  Answer answer = ownership(options.path);
  const std::string owner = answer["owner"];
  const std::string group = answer["group"];
  if ((options.owner &&
       vra_getpwnam_uid(owner.c_str()) != vra_getpwnam_uid(options.owner->c_str())) ||
      (options.group &&
       vra_getgrnam_gid(group.c_str()) != vra_getgrnam_gid(options.group->c_str())) ||
      answer["mode"] != octal(mode)) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS,
                  options.path + " did not get the requested owner, group and mode, but " + owner +
                      ", " + group + ", " + answer["mode"].get<std::string>());
  }
  return answer;
}

// The answer of a dry run.
Answer plannedChange(const char* change, const std::string& path) {
  return {{"would", change}, {"path", path}};
}

Answer plannedCreation(const char* change, const Options& options, unsigned int mode) {
  Answer answer = plannedChange(change, options.path);
  if (options.owner) answer["owner"] = *options.owner;
  if (options.group) answer["group"] = *options.group;
  answer["mode"] = octal(mode);
  return answer;
}

void requireAccess(const std::string& path, int access) {
  if (faccessat(AT_FDCWD, path.c_str(), access, AT_EACCESS) != 0) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, path + ": " + strerror(errno));
  }
}

// Requires that entries can be created and removed in the directory of the path.
void requireWritableDirectoryOf(const std::string& path) {
  if (path.empty()) throw Failure(OSUTILS_NO_SUCH_OBJECT, "the path is empty");
  const std::string directory = std::filesystem::path(path).parent_path();
  requireAccess(directory.empty() ? "." : directory, W_OK | X_OK);
}

// The parent of "a/b/" is "a", not "a/b".
std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.ends_with('/')) path.pop_back();
  return path;
}

// True for a dangling link as well. If it cannot be known, fails with this text: a caller would take
// an existing file for a new one.
bool entryExists(const std::string& path, const std::string& failed) {
  struct stat status;
  if (lstat(path.c_str(), &status) == 0) return true;
  if (errno == ENOENT || errno == ENOTDIR) return false;
  throw Failure(failed, path);
}

// Follows links, also to a target that does not exist.
std::string linkTarget(std::filesystem::path path) {
  std::error_code unknown;
  for (int links = 0; links < 40 && std::filesystem::is_symlink(path, unknown); ++links) {
    const std::filesystem::path target = std::filesystem::read_symlink(path, unknown);
    if (unknown) break;
    path = path.parent_path() / target;
  }
  return path;
}

bool isRealDirectory(const std::string& path) {
  std::error_code unknown;
  return std::filesystem::is_directory(std::filesystem::symlink_status(path, unknown));
}

Answer status(Options& options) {
  char* const path = options.path.data();
  return {{"path", options.path},
          {"name", orNoMemory(osutils::getFileNameFromPath(options.path))},
          {"exists", doesFileExist(path)},
          {"accessible", canAccessFile(path)},
          {"directory", isDirectory(path)},
          {"file", isFile(path)}};
}

Answer check(Options& options) {
  const int code = checkFilePerms(options.path.c_str());
  if (code != OSUTILS_SUCCESS) throw Failure(code, options.path);
  return {{"path", options.path}, {"code", code}};
}

// Only regular files: the size of others does not tell whether the copy is complete.
Answer copy(Options& options, bool dry_run) {
  const std::string& source = options.path;
  const std::string& destination = options.destination;
  const unsigned int mode = modeOr(options, kNewFileMode);
  requireAccounts(options);
  requireRegularFile(source);
  requireRegularFile(destination);
  std::error_code unknown;
  if (std::filesystem::equivalent(source, destination, unknown)) {
    throw Failure(OSUTILS_UNWILLING_TO_PERFORM,
                  source + " and " + destination + " are the same file");
  }
  const auto cannotCopy = [&] {
    const bool unreadable = checkFilePerms(source.c_str()) != OSUTILS_SUCCESS;
    return Failure("cannot copy " + source + " to " + destination,
                   unreadable ? source : destination);
  };
  struct stat status;
  const bool created = stat(destination.c_str(), &status) != 0;
  if (created && errno != ENOENT) throw cannotCopy();
  if (dry_run) {
    if (checkFilePerms(source.c_str()) != OSUTILS_SUCCESS ||
        isDirectory(options.destination.data())) {
      throw cannotCopy();
    }
    requireAccess(source, R_OK);
    if (created) {
      requireWritableDirectoryOf(destination);
    } else {
      requireAccess(destination, W_OK);
    }
    return {{"would", created ? "create" : "overwrite"},
            {"source", source},
            {"destination", destination}};
  }
  if (!copyFile(source.c_str(), options.destination.data(), orNull(options.owner),
                orNull(options.group), mode)) {
    throw cannotCopy();
  }
  // the library does not report write errors
  const auto wanted = std::filesystem::file_size(source, unknown);
  const auto written = std::filesystem::file_size(destination, unknown);
  if (unknown || written < wanted) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  "the copy of " + source + " in " + destination + " is incomplete");
  }
  if (created) {
    Options made = options;
    made.path = destination;
    (void)ownershipAsAsked(made, mode);
  }
  return {{"source", source}, {"destination", destination}, {"created", created}};
}

Answer createFile(Options& options, bool dry_run) {
  const unsigned int mode = modeOr(options, kNewFileMode);
  requireAccounts(options);
  requireRegularFile(options.path);
  const bool replaces = entryExists(options.path, "cannot create " + options.path);
  if (replaces && !options.force && !isDirectory(options.path.data())) {
    throw Failure(OSUTILS_ALREADY_EXISTS,
                  options.path + " exists; --force replaces it with an empty file");
  }
  if (dry_run) {
    if (isDirectory(options.path.data())) {
      throw Failure("cannot create " + options.path, options.path);
    }
    requireWritableDirectoryOf(options.path);
    return plannedCreation(replaces ? "replace" : "create", options, mode);
  }
  if (!::createFile(options.path.data(), orNull(options.owner), orNull(options.group), mode)) {
    throw Failure("cannot create " + options.path, options.path);
  }
  std::error_code unknown;
  if (std::filesystem::file_size(options.path, unknown) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  options.path + " could not be removed and keeps its contents");
  }
  return ownershipAsAsked(options, mode);
}

Answer deleteFile(Options& options, bool dry_run) {
  if (dry_run) {
    if (!entryExists(options.path, "cannot delete " + options.path) ||
        isRealDirectory(options.path)) {
      throw Failure("cannot delete " + options.path, options.path);
    }
    requireWritableDirectoryOf(options.path);
    return plannedChange("delete", options.path);
  }
  if (!::deleteFile(options.path.data())) {
    throw Failure("cannot delete " + options.path, options.path);
  }
  return {{"deleted", options.path}};
}

Answer clear(Options& options, bool dry_run) {
  requireRegularFile(options.path);
  if (dry_run) {
    std::error_code unknown;
    const auto size = std::filesystem::file_size(options.path, unknown);
    if (unknown) {
      const std::string failed = "cannot clear " + options.path;
      const std::string made = linkTarget(options.path);
      if (entryExists(made, failed)) throw Failure(failed, options.path);
      requireWritableDirectoryOf(made);
      return plannedChange("create", options.path);
    }
    requireAccess(options.path, W_OK);
    Answer answer = plannedChange("empty", options.path);
    answer["bytes"] = size;
    return answer;
  }
  if (!clearFile(options.path.c_str())) throw Failure("cannot clear " + options.path, options.path);
  return {{"cleared", options.path}};
}

// The library sets all three at once: the current values stand in for those that are not given.
Answer owner(Options& options, bool dry_run) {
  if (!options.owner && !options.group && !options.mode) return ownership(options.path);
  Options wanted = options;
  (void)modeOr(options, 0);
  requireAccounts(options);
  if (!options.owner || !options.group || !options.mode) {
    const Answer now = ownership(options.path);
    if (!wanted.owner) wanted.owner = now["owner"];
    if (!wanted.group) wanted.group = now["group"];
    if (!wanted.mode) wanted.mode = now["mode"];
  }
  const unsigned int mode = modeOr(wanted, 0);
  if (dry_run) {
    struct stat status;
    if (stat(wanted.path.c_str(), &status) != 0) {
      throw Failure("cannot set the owner, group and mode of " + options.path, options.path);
    }
    if (geteuid() != 0 && geteuid() != status.st_uid) {
      throw Failure(OSUTILS_INSUFFICIENT_ACCESS, options.path + " belongs to another user");
    }
    return plannedCreation("set", wanted, mode);
  }
  if (!setFileOwnersAndPermissions(FILE_DESC_USE_PATH, wanted.path.data(), orNull(wanted.owner),
                                   orNull(wanted.group), mode)) {
    throw Failure("cannot set the owner, group and mode of " + options.path, options.path);
  }
  return ownershipAsAsked(wanted, mode);
}

Answer createDirectory(Options& options, bool dry_run) {
  const unsigned int mode = modeOr(options, kNewDirectoryMode);
  requireAccounts(options);
  if (dry_run) {
    const std::string failed = "cannot create " + options.path;
    const std::string plain = withoutTrailingSlashes(options.path);
    if (entryExists(plain, failed)) throw Failure(failed, options.path);
    requireWritableDirectoryOf(plain);
    return plannedCreation("create", options, mode);
  }
  if (!::createDirectory(options.path.data(), orNull(options.owner), orNull(options.group), mode)) {
    throw Failure("cannot create " + options.path, options.path);
  }
  return ownershipAsAsked(options, mode);
}

// The library passes the path of a tree to a shell, unquoted.
void requireTree(std::string& path) {
  if (!isShellWord(path)) {
    throw notShellWord("path", path);
  }
  // With a trailing slash, rm would empty a link's target instead of removing the link.
  path = withoutTrailingSlashes(path);
}

bool deleteTree(std::string& path) {
  std::error_code unknown;
  if (!std::filesystem::is_directory(path, unknown)) return false;  // isDirectory accepts more
  // Closes standard error in the shell, whose command prints a line for each entry that it cannot
  // remove. This process still needs it.
  (void)fcntl(STDERR_FILENO, F_SETFD, FD_CLOEXEC);
  return deleteDirForcefully(path.data()) && !entryExists(path, "cannot delete " + path);
}

// True for a path that neither rmdir() nor rm removes.
bool isRootOrDots(const std::string& path) {
  const std::string name = std::filesystem::path(withoutTrailingSlashes(path)).filename();
  return name == "." || name == ".." || withoutTrailingSlashes(path) == "/";
}

Answer plannedDeletion(const Options& options) {
  const std::string& path = options.path;
  std::error_code unknown;
  std::error_code unread;
  const bool is_link = std::filesystem::is_symlink(path, unknown);
  std::uintmax_t entries = 0;
  if (!is_link) {
    std::filesystem::recursive_directory_iterator entry(path, unread);
    for (; !unread && entry != end(entry); entry.increment(unread)) ++entries;
  }
  if (!std::filesystem::is_directory(path, unknown) || isRootOrDots(path) ||
      (!options.force && (is_link || entries != 0))) {
    throw Failure("cannot delete " + path, path);
  }
  if (unread) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  "cannot count the entries of " + path + ": " + unread.message());
  }
  requireWritableDirectoryOf(withoutTrailingSlashes(path));
  Answer answer = plannedChange("delete", path);
  answer["entries"] = entries;
  return answer;
}

Answer deleteDirectory(Options& options, bool dry_run) {
  if (options.force) requireTree(options.path);
  if (dry_run) return plannedDeletion(options);
  if (!(options.force ? deleteTree(options.path) : ::deleteDirectory(options.path.c_str()))) {
    throw Failure("cannot delete " + options.path, options.path);
  }
  return {{"deleted", options.path}};
}

Answer trim(Options& options) {
  std::string trimmed = options.path;
  char* text = trimmed.data();
  (void)trimLastDirectory(&text);
  return {{"path", options.path}, {"trimmed", text}};
}

Answer space(Options& options) {
  const long required = numberFrom<long>(options.mebibytes, "MIB", "a whole number");
  if (!doesFileExist(options.path.c_str())) {
    throw Failure("cannot determine the free space at " + options.path, options.path);
  }
  return {{"path", options.path},
          {"mib", required},
          {"enough", isEnoughDriveSpace(required, options.path.data())}};
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();
  const Tool::Argument path = {"PATH", &options->path, "The path", kFile};
  const Tool::Argument directory_path = {"PATH", &options->path, "The path", kDirectory};
  const auto takeOwnership = [&](Command& command, const std::string& owner,
                                 const std::string& group, const std::string& mode) {
    tool.option(command, "--owner", "USER", options->owner, "The owner" + owner, kUser);
    tool.option(command, "--group", "GROUP", options->group, "The group" + group, kGroup);
    tool.option(command, "--mode", "OCTAL", options->mode, "The permission bits" + mode);
  };
  const std::string caller = ", the caller by default";
  const std::string primary = ", the owner's primary group by default";

  Command& file = tool.family("file", "Inspect, copy, create and delete files");
  tool.command(file, "stat", "Show whether a path exists, and what it is", bound(options, status),
               {path});
  tool.command(file, "check", "Check that the path exists and is not a directory",
               bound(options, check), {path});
  Command& copying = tool.change(
      file, "copy",
      "Copy a regular file. An existing destination is overwritten and keeps\n"
      "its owner, group and mode; the options are for a new one",
      bound(options, copy),
      {{"SOURCE", &options->path, "The file to copy", kFile},
       {"DEST", &options->destination, "The path of the copy, not a directory", kFile}});
  takeOwnership(copying, caller, primary, ", 640 by default");
  Command& creation =
      tool.change(file, "create", "Create an empty file", bound(options, createFile), {path});
  tool.flag(creation, "--force", options->force, "Replace an existing file; its contents are lost");
  takeOwnership(creation, caller, primary, ", 640 by default");
  tool.change(file, "delete", "Remove a file or a link", bound(options, deleteFile), {path});
  tool.change(file, "clear",
              "Empty a file, or create it. Waits while another process locks the file",
              bound(options, clear), {path});
  Command& owning =
      tool.change(file, "owner",
                  "Show the owner, group and mode of a path, after the options have set\n"
                  "those that they name",
                  bound(options, owner), {path});
  takeOwnership(owning, "", "", "");

  Command& directory = tool.family("dir", "Create and delete directories");
  Command& making = tool.change(directory, "create", "Create a directory; its parent must exist",
                                bound(options, createDirectory), {directory_path});
  takeOwnership(making, caller, primary, ", 750 by default");
  Command& removal = tool.change(directory, "delete", "Remove an empty directory",
                                 bound(options, deleteDirectory), {directory_path});
  tool.flag(removal, "--force", options->force,
            "Remove its contents as well. Refuses a path with a blank, a tab, \"#\",\n"
            "a leading \"-\" or a character that a shell interprets");
  tool.command(directory, "trim", "Show the path without its last component; only the text matters",
               bound(options, trim), {directory_path});

  tool.question(tool.all(), "space",
                "Ask whether the file system of a path has this many MiB of free space",
                bound(options, space), {{"MIB", &options->mebibytes, "How many MiB"}, path});
}

}  // namespace files
