#include "edited_file.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <vector>

#include "difference.h"

namespace {

// The descriptors that an editor has open at the same time, and one to spare.
constexpr size_t kEditDescriptors = 5;

class Descriptor {
 public:
  explicit Descriptor(int descriptor) : descriptor_(descriptor) {}
  ~Descriptor() {
    if (descriptor_ != -1) (void)close(descriptor_);
  }
  Descriptor(Descriptor&& other) noexcept : descriptor_(other.descriptor_) {
    other.descriptor_ = -1;
  }
  Descriptor& operator=(Descriptor&&) = delete;

  int get() const { return descriptor_; }
  explicit operator bool() const { return descriptor_ != -1; }

 private:
  int descriptor_;
};

std::string reason() { return strerror(errno); }

std::string folderOf(const std::string& path) {
  const std::string folder = std::filesystem::path(path).parent_path().string();
  return folder.empty() ? "." : folder;
}

bool isThere(const std::string& path) {
  struct stat status;
  return lstat(path.c_str(), &status) == 0;
}

// Returns the contents of a regular file, or nullopt and errno: EINVAL if it is not regular.
std::optional<std::string> contentsOf(const std::string& path, int flags = 0) {
  const Descriptor file(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | flags));
  struct stat status;
  if (!file || fstat(file.get(), &status) != 0) return std::nullopt;
  if (!S_ISREG(status.st_mode)) {
    errno = EINVAL;
    return std::nullopt;
  }
  std::string text;
  std::vector<char> block(size_t{64} * 1024);
  ssize_t size = 0;
  while ((size = read(file.get(), block.data(), block.size())) > 0) {
    text.append(block.data(), static_cast<size_t>(size));
  }
  if (size != 0) return std::nullopt;
  return text;
}

// A file system without support for fsync is no failure.
bool syncFile(int descriptor) {
  return fsync(descriptor) == 0 || errno == EINVAL || errno == EROFS;
}

bool syncFolderOf(const std::string& path) {
  const Descriptor folder(open(folderOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return folder && syncFile(folder.get());
}

// Replaces the contents of the file. Returns false, with errno set, on failure.
bool rewrite(int descriptor, const std::string& text) {
  size_t written = 0;
  while (written < text.size()) {
    const ssize_t size = pwrite(descriptor, text.data() + written, text.size() - written,
                                static_cast<off_t>(written));
    if (size < 0) return false;
    written += static_cast<size_t>(size);
  }
  return ftruncate(descriptor, static_cast<off_t>(text.size())) == 0;
}

// Quotes the text as one word for a shell.
std::string shellQuoted(const std::string& text) {
  const bool is_plain = !text.empty() && std::all_of(text.begin(), text.end(), [](char c) {
    return isAsciiLetter(c) || isAsciiDigit(c) || strchr("/._-+:@%,", c) != nullptr;
  });
  if (is_plain) return text;
  std::string word = "'";
  for (const char c : text) word += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return word + "'";
}

std::string removeCommand(const std::string& path) { return "rm -- " + shellQuoted(path); }

const char* kindOf(mode_t mode) {
  switch (mode & S_IFMT) {
    case S_IFLNK:
      return "a symbolic link";
    case S_IFDIR:
      return "a directory";
    case S_IFIFO:
      return "a FIFO";
    case S_IFSOCK:
      return "a socket";
    default:
      return "a device";
  }
}

// Returns nullopt if the file cannot be read.
std::optional<bool> answerTo(const std::function<bool()>& question) {
  try {
    return question();
  } catch (const Failure&) {
    return std::nullopt;
  }
}

bool isLastLineComplete(const std::string& text) { return text.empty() || text.ends_with('\n'); }

// Returns the text without the lines whose first word is the name. A word ends at a character of
// `ends`. Like the editors, splits long lines into pieces.
std::string without(const std::string& name, std::string_view ends, std::string_view text) {
  constexpr size_t kLongestLine = 1023;
  std::string rest;
  while (!text.empty()) {
    const size_t length = std::min({text.find('\n'), text.size() - 1, kLongestLine - 1}) + 1;
    const std::string_view line = text.substr(0, length);
    const std::string_view word =
        line.substr(std::min(line.find_first_not_of(" \t\n\v\f\r"), line.size()));
    if (word.substr(0, word.find_first_of(ends)) != name) rest += line;
    text.remove_prefix(length);
  }
  return rest;
}

Failure refusal(const std::string& what) { return Failure(OSUTILS_UNWILLING_TO_PERFORM, what); }

// A deletion truncates the file only after the copy is complete, and then leaves lines out. So if
// the file begins with all of the copy, the file is complete.
bool isRedundant(const std::string& copy, const std::string& text) {
  return text.starts_with(copy);
}

void requireFileSize(uint64_t bytes, const std::string& path) {
  rlimit limit = {};
  if (getrlimit(RLIMIT_FSIZE, &limit) == 0 && limit.rlim_cur != RLIM_INFINITY &&
      bytes > limit.rlim_cur) {
    throw refusal("this process may not write the " + std::to_string(bytes) + " bytes of " + path +
                  ": its limit is " + std::to_string(limit.rlim_cur));
  }
}

// The free bytes of the file system of `path`; nullopt if it does not count blocks.
std::optional<uint64_t> freeBytes(const std::string& path, const struct statvfs& system) {
  if (system.f_blocks == 0) return std::nullopt;
  if (system.f_files != 0 && system.f_favail == 0) {
    throw refusal("the file system of " + path + " has no free inodes");
  }
  return uint64_t{geteuid() == 0 ? system.f_bfree : system.f_bavail} * system.f_frsize;
}

uint64_t roundedToBlocks(uint64_t bytes, const struct statvfs& system) {
  const uint64_t block = std::max<uint64_t>(system.f_frsize, 1);
  return (bytes + block - 1) / block * block;
}

void requireRoom(const std::string& path, uint64_t needed, const struct statvfs& system) {
  const std::optional<uint64_t> room = freeBytes(path, system);
  if (room && *room < needed) {
    throw refusal("no space left for " + path + ": " + std::to_string(needed) +
                  " bytes are needed, " + std::to_string(*room) + " are free");
  }
}

// Refuses if the file cannot grow to this size.
void requireGrowth(const std::string& path, int descriptor, uint64_t bytes) {
  struct stat status;
  struct statvfs system;
  requireFileSize(bytes, path);
  if (fstat(descriptor, &status) != 0 || fstatvfs(descriptor, &system) != 0) return;
  const uint64_t has = static_cast<uint64_t>(status.st_blocks) * 512;
  if (bytes > has) requireRoom(path, roundedToBlocks(bytes - has, system), system);
}

}  // namespace

bool isAsciiLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
bool isAsciiDigit(char c) { return c >= '0' && c <= '9'; }
bool isAsciiControl(char c) { return static_cast<unsigned char>(c) < ' ' || c == 127; }

Stream openToRead(const std::string& path) {
  Stream stream(fopen(path.c_str(), "re"));
  if (!stream) throw Failure(OSUTILS_OPERATIONS_ERROR, path + ": " + strerror(errno));
  return stream;
}

// ---- Options ----

const char* const kDeletionHelp =
    ". The file is rewritten in place: keep\n"
    "programs that ignore its lock from editing it. The backup path has a\n"
    "copy until the command ends; an older copy there stops the command";

const char* const kRestorationHelp =
    "Show how the file differs from the copy that a failed deletion left,\n"
    "ask, put the copy back and remove it. If the file begins with all of\n"
    "the copy, only remove the copy";

void EditedFile::addOptions(Tool& tool, Command& command) {
  tool.option(command, "--file", "FILE", file_,
              std::string("The file to use instead of ") + editors_file_, kFile);
  tool.option(command, "--backup", "PATH", backup_,
              "Where delete keeps its temporary copy, instead of FILE.vrasave", kFile);
}

void EditedFile::addEditOptions(Tool& tool, Command& command) {
  tool.flag(command, "--no-lock", no_lock_, "Do not lock FILE.lock: the caller holds a lock");
  tool.flag(command, "--discard-backup", discard_backup_,
            "Remove the copy that an earlier edit left, if you own it and it is\n"
            "readable");
}

void EditedFile::addRestoreOptions(Tool& tool, Command& command) {
  tool.flag(command, "--no-lock", no_lock_, "Do not lock FILE.lock: the caller holds a lock");
  tool.flag(command, "--yes", yes_, "Do not ask");
  tool.flag(command, "--force", force_,
            "Put the copy back even if it is only the beginning of the file");
}

void EditedFile::select() {
  if (backup_ && backup_->empty()) throw Usage("--backup is empty");
  path_ = file_.value_or(editors_file_);
  backup_path_ = backup_.value_or(file_ ? *file_ + ".vrasave" : editors_backup_);
  editors_file_ = path_.c_str();
  editors_backup_ = backup_path_.c_str();
}

std::string EditedFile::restoreCommand() const {
  return std::string("osutils ") + family_ + " restore" +
         (file_ ? " --file " + shellQuoted(*file_) : "") +
         (backup_ ? " --backup " + shellQuoted(*backup_) : "");
}

// ---- Before an edit ----

Edit::Edit(const EditedFile& options, bool dry_run)
    : options_(options), path_(options.path_), backup_(options.backup_path_), dry_run_(dry_run) {
  const int code = checkFilePerms(path_.c_str());
  if (code != OSUTILS_SUCCESS) throw Failure(code, "cannot read " + path_);
  requireRegularFile(path_);
  if (faccessat(AT_FDCWD, path_.c_str(), W_OK, AT_EACCESS) != 0) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot write " + path_ + ": " + reason());
  }
  if (!options.no_lock_ && !dry_run) lock_.emplace(path_);
  std::optional<std::string> text = contentsOf(path_);
  if (!text) throw Failure("cannot read " + path_ + ": " + reason(), path_);
  before_ = std::move(*text);
  requireFreeBackup();  // before the contents of the file are judged
}

Edit::~Edit() {
  if (descriptor_ != -1) (void)close(descriptor_);
}

// Kept open, so that the file can be restored even if no more descriptors are available.
void Edit::openToWrite(int flags) {
  descriptor_ = open(path_.c_str(), O_WRONLY | O_NOCTTY | O_NONBLOCK | O_CLOEXEC | flags);
  if (descriptor_ == -1) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot write " + path_ + ": " + reason());
  }
}

// A file at the backup path may be the only complete copy: refuse to overwrite it.
void Edit::requireFreeBackup() {
  struct stat copy_status;
  struct stat followed;
  struct stat own;
  if (lstat(backup_.c_str(), &copy_status) != 0) {
    if (errno == ENOENT) return;
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS,
                  "cannot look at the backup path " + backup_ + ": " + reason());
  }
  if (stat(backup_.c_str(), &followed) == 0 && stat(path_.c_str(), &own) == 0 &&
      followed.st_dev == own.st_dev && followed.st_ino == own.st_ino) {
    throw refusal("the backup path " + backup_ + " is the file itself");
  }
  if (!S_ISREG(copy_status.st_mode)) {
    throw refusal("the backup path " + backup_ + " is " + kindOf(copy_status.st_mode));
  }
  if (lock_ && lock_->isLockFile(copy_status)) {
    throw refusal("the backup path " + backup_ + " is the lock");
  }
  const std::optional<std::string> copy = contentsOf(backup_, O_NOFOLLOW);
  const std::string why = copy ? "" : reason();
  const bool is_own = copy_status.st_uid == geteuid();
  if (options_.discard_backup_) {
    if (!copy) throw refusal("--discard-backup: cannot read " + backup_ + ": " + why);
    if (!is_own) throw refusal("--discard-backup: " + backup_ + " belongs to another user");
    discard_ = true;
    return;
  }
  const std::string left = "an earlier edit left a copy at " + backup_;
  if (!copy) {
    throw refusal(left + ", which cannot be read: " + why +
                  (is_own ? "; to make it readable: chmod u+r -- " + shellQuoted(backup_) : ""));
  }
  if (isRedundant(*copy, before_)) {
    throw refusal(left + ", all of which is in " + path_ +
                  "; to remove it: " + options_.restoreCommand());
  }
  throw refusal(left + ", and " + path_ +
                " may have lost lines since; to compare them and restore the copy: " +
                options_.restoreCommand());
}

void Edit::requireRoomForCopy() const {
  requireFileSize(before_.size(), backup_);
  const std::string folder = folderOf(backup_);
  if (faccessat(AT_FDCWD, folder.c_str(), W_OK | X_OK, AT_EACCESS) != 0) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS,
                  "cannot make a copy of " + path_ + " in " + folder + ": " + reason());
  }
  struct stat of_folder;
  struct stat of_file;
  struct statvfs folders_system;
  struct statvfs files_system;
  if (stat(folder.c_str(), &of_folder) != 0 || fstat(descriptor_, &of_file) != 0 ||
      statvfs(folder.c_str(), &folders_system) != 0 || fstatvfs(descriptor_, &files_system) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  "cannot determine the free space for a copy in " + folder + ": " + reason());
  }
  // Another process may take the blocks that truncating frees before the file is rewritten.
  const uint64_t copy = roundedToBlocks(before_.size(), folders_system);
  const uint64_t anew = roundedToBlocks(before_.size(), files_system);
  if (of_folder.st_dev == of_file.st_dev) {
    requireRoom(backup_, copy + anew, folders_system);
  } else {
    requireRoom(backup_, copy, folders_system);
    requireRoom(path_, anew, files_system);
  }
}

void Edit::requireDescriptors() const {
  std::vector<Descriptor> taken;
  for (size_t i = 0; i < kEditDescriptors; ++i) {
    taken.emplace_back(open(path_.c_str(), O_RDONLY | O_CLOEXEC));
    if (!taken.back()) {
      throw Failure(OSUTILS_UNAVAILABLE,
                    "not enough descriptors to edit " + path_ + ": " + reason());
    }
  }
}

std::optional<Answer> Edit::prepareToAppend(const std::string& line) {
  openToWrite(O_APPEND);
  requireGrowth(path_, descriptor_, before_.size() + line.size());
  requireDescriptors();
  return diffOrDiscardBackup(before_ + line);
}

std::optional<Answer> Edit::prepareToDelete(const std::string& wanted) {
  openToWrite(0);
  requireRoomForCopy();
  requireDescriptors();
  return diffOrDiscardBackup(wanted);
}

// The last step before the editor writes.
std::optional<Answer> Edit::diffOrDiscardBackup(const std::string& wanted) const {
  if (dry_run_) return unifiedDiff(path_, before_, path_, wanted);
  if (discard_ && unlink(backup_.c_str()) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot remove " + backup_ + ": " + reason());
  }
  return std::nullopt;
}

// ---- The edit ----

bool Edit::hasLineOf(const std::string& name, std::string_view ends) const {
  return without(name, ends, before_) != before_;
}

void Edit::requireCompleteLastLine() const {
  if (isLastLineComplete(before_)) return;
  throw refusal("the last line of " + path_ + " has no newline: the new one would join it");
}

std::optional<Answer> Edit::append(const std::string& name, const std::string& line,
                                   const std::function<int()>& add,
                                   const std::function<bool()>& is_there) {
  if (auto answer = prepareToAppend(line)) return answer;
  const int code = add();
  finishAddition(code, line, answerTo(is_there), "add " + inQuotes(name) + " to " + path_);
  return std::nullopt;
}

Answer Edit::remove(const Lines& lines, const std::string& name, const std::function<int()>& remove,
                    const std::function<bool()>& is_there) {
  const std::string wanted = without(name, lines.ends, before_);
  if (wanted == before_) {
    throw refusal("no line of " + path_ + " has the exact " + lines.key + " " + inQuotes(name));
  }
  if (const auto answer = prepareToDelete(wanted)) return *answer;
  // Built before the edit: there may be no memory afterwards.
  const std::string what = "delete " + inQuotes(name) + " from " + path_;
  const std::string hint = printable("osutils: " + backup_ + " may be a complete copy of " + path_ +
                                     "; to restore it: " + options_.restoreCommand()) +
                           "\n";
  try {
    finishDeletion(remove(), wanted, what);
  } catch (const std::bad_alloc&) {
    struct stat status;
    if (lstat(backup_.c_str(), &status) == 0 || errno != ENOENT) (void)fputs(hint.c_str(), stderr);
    throw;
  }
  const std::optional<bool> still_there = answerTo(is_there);
  if (!still_there) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  path_ + " is edited as requested but cannot be read again");
  }
  if (*still_there) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  path_ + " still has " + lines.entry + " " + inQuotes(name));
  }
  return {{"deleted", name}};
}

// ---- After an edit ----

bool Edit::restoreContents() {
  return rewrite(descriptor_, before_) && syncFile(descriptor_) && contentsOf(path_) == before_;
}

void Edit::finishAddition(int code, const std::string& line, std::optional<bool> is_there,
                          const std::string& what) {
  const std::string failed = "cannot " + what;
  if (code == OSUTILS_SUCCESS) code = OSUTILS_OPERATIONS_ERROR;
  const std::optional<std::string> now = contentsOf(path_);
  std::string why =
      is_there ? "its line was not completely written" : "its line could not be read again";
  if (is_there.value_or(false) && now && isLastLineComplete(*now)) {
    if (syncFile(descriptor_)) return;
    why = "its line could not be flushed to the disk: " + reason();
  }
  if (!now) {
    throw Failure(code, failed + "; " + path_ + " may have it but cannot be read: " + reason());
  }
  const bool is_own_part =
      now->starts_with(before_) && line.starts_with(std::string_view(*now).substr(before_.size()));
  if (!is_own_part) {
    throw Failure(code, failed + ": " + why + "; another program changed " + path_ +
                            " meanwhile: check its last lines");
  }
  const auto size = static_cast<off_t>(before_.size());
  if (*now != before_ && ftruncate(descriptor_, size) != 0) {
    throw Failure(code, failed + ": " + why + "; " + path_ + " ends with a part of it (" +
                            reason() + "); to remove that part: truncate -s " +
                            std::to_string(size) + " -- " + shellQuoted(path_));
  }
  (void)syncFile(descriptor_);
  throw Failure(code, failed + ": " + why + "; " + path_ + " is unchanged");
}

void Edit::finishDeletion(int code, const std::string& wanted, const std::string& what) {
  const std::string failed = "cannot " + what;
  const std::optional<std::string> now = contentsOf(path_);
  const std::optional<std::string> copy = contentsOf(backup_, O_NOFOLLOW);
  // The backup path was free before, so the copy is from this edit.
  const auto removeCopy = [&]() -> std::string {
    if (unlink(backup_.c_str()) == 0 || errno == ENOENT) return "";
    return "; the copy at " + backup_ + " is no longer needed but cannot be removed (" + reason() +
           "): " + removeCommand(backup_);
  };
  if (code == OSUTILS_SUCCESS) {
    if (!isThere(backup_)) return;
    const std::string left = removeCopy();
    if (left.empty()) return;
    throw Failure(OSUTILS_OPERATIONS_ERROR, path_ + " is edited as requested" + left);
  }
  if (now == before_) throw Failure(code, failed + "; " + path_ + " is unchanged" + removeCopy());
  if (copy == before_) {
    const std::string state =
        now == wanted ? " is edited but may not be on the disk yet (to keep the edit: " +
                            removeCommand(backup_) + "); "
                      : " is incomplete; ";
    throw Failure(code, failed + "; " + path_ + state + backup_ +
                            " is a complete copy; to restore it: " + options_.restoreCommand());
  }
  // Overwrite the file only if its contents are what the editor left.
  if (now && wanted.starts_with(*now) && restoreContents()) {
    throw Failure(code, failed + "; " + path_ + " is unchanged" + removeCopy());
  }
  if (!copy && isThere(backup_)) {
    throw Failure(code, failed + "; " + path_ + " may be damaged, and the copy at " + backup_ +
                            ", which may be complete, cannot be read; to restore it: " +
                            options_.restoreCommand());
  }
  throw Failure(code, failed + "; " + path_ + " is damaged (" +
                          (now ? std::to_string(now->size()) + " bytes" : "unreadable") + ", was " +
                          std::to_string(before_.size()) +
                          " bytes), and there is no complete copy" + removeCopy());
}

// ---- Putting a copy back ----

namespace {

std::string requireCopy(const std::string& backup) {
  struct stat status;
  if (lstat(backup.c_str(), &status) != 0) {
    if (errno == ENOENT) {
      throw Failure(OSUTILS_NO_SUCH_OBJECT, "there is no copy at " + backup);
    }
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot look at " + backup + ": " + reason());
  }
  if (!S_ISREG(status.st_mode)) throw refusal(backup + " is " + kindOf(status.st_mode));
  std::optional<std::string> copy = contentsOf(backup, O_NOFOLLOW);
  if (!copy) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot read " + backup + ": " + reason());
  }
  return std::move(*copy);
}

// The contents of the file; "" if it no longer exists.
std::string contentsOrEmpty(const std::string& path) {
  std::optional<std::string> text = contentsOf(path);
  if (text) return std::move(*text);
  if (errno == ENOENT) return "";
  if (errno == EINVAL) throw refusal(path + " is not a regular file");
  throw Failure("cannot read " + path + ": " + reason(), path);
}

void requireRestorable(const std::string& path, const std::string& backup) {
  const auto isWritable = [](const std::string& place, int access) {
    return faccessat(AT_FDCWD, place.c_str(), access, AT_EACCESS) == 0;
  };
  if (!isWritable(path, W_OK) &&
      (path.empty() || errno != ENOENT || !isWritable(folderOf(path), W_OK | X_OK))) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot write " + path + ": " + reason());
  }
  if (!isWritable(folderOf(backup), W_OK | X_OK)) {
    throw Failure(OSUTILS_INSUFFICIENT_ACCESS, "cannot remove " + backup + ": " + reason());
  }
}

// Shows what is about to be done, and asks for confirmation unless `yes`.
void confirm(bool yes, const std::string& what, const std::string& question) {
  if (!yes && isatty(STDIN_FILENO) == 0) {
    throw Usage("there is no terminal to ask on: --dry-run shows the change, --yes makes it");
  }
  printText(what);
  if (yes) return;
  (void)fputs(printable(question + " [y/N] ").c_str(), stderr);
  char answer[16] = "";
  const bool is_yes = fgets(answer, sizeof answer, stdin) != nullptr &&
                      (strcasecmp(answer, "y\n") == 0 || strcasecmp(answer, "yes\n") == 0);
  if (!is_yes) throw refusal("nothing was changed");
}

}  // namespace

Answer restore(const EditedFile& options, bool dry_run) {
  const std::string& path = options.path_;
  const std::string& backup = options.backup_path_;
  (void)requireCopy(backup);
  (void)contentsOrEmpty(path);
  std::optional<EditLock> lock;
  if (!options.no_lock_ && !dry_run) lock.emplace(path);
  struct stat status;
  if (lock && lstat(backup.c_str(), &status) == 0 && lock->isLockFile(status)) {
    throw refusal("the backup path " + backup + " is the lock");
  }
  const std::string copy = requireCopy(backup);
  const std::string text = contentsOrEmpty(path);
  std::error_code unknown;
  if (std::filesystem::equivalent(path, backup, unknown)) {
    throw refusal("the backup path " + backup + " is the file itself");
  }
  const bool is_redundant = isRedundant(copy, text) && (copy == text || !options.force_);
  const std::string what = is_redundant ? "all of " + backup + " is in " + path + "\n"
                                        : unifiedDiff(path, text, backup, copy);
  if (dry_run) {
    requireRestorable(path, backup);
    return what;
  }
  confirm(options.yes_, what,
          is_redundant ? "Remove " + backup + "?" : "Put " + backup + " back into " + path + "?");
  if (requireCopy(backup) != copy || contentsOrEmpty(path) != text) {
    throw refusal("one of the files changed meanwhile; nothing was done");
  }

  const auto require = [&](bool done, const std::string& failed) {
    if (!done) {
      throw Failure(OSUTILS_OPERATIONS_ERROR, failed + ": " + reason() + "; the copy is still at " +
                                                  backup +
                                                  "; to try again: " + options.restoreCommand());
    }
  };
  const Descriptor from(open(backup.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  require(from && syncFile(from.get()) && syncFolderOf(backup), "cannot flush " + backup);
  const Descriptor to(
      open(path.c_str(), O_WRONLY | O_CREAT | O_NOCTTY | O_NONBLOCK | O_CLOEXEC, 0644));
  require(static_cast<bool>(to), "cannot write " + path);
  if (!is_redundant) {
    requireGrowth(path, to.get(), copy.size());
    require(rewrite(to.get(), copy) && contentsOf(path) == copy, "cannot write all of " + path);
  }
  // The file must be on the disk before its copy is removed.
  require(syncFile(to.get()) && syncFolderOf(path), "cannot flush " + path);
  if (unlink(backup.c_str()) != 0) {
    throw Failure(OSUTILS_OPERATIONS_ERROR,
                  path + (is_redundant ? " is complete" : " is restored") +
                      "; the copy cannot be removed (" + reason() + "): " + removeCommand(backup));
  }
  (void)syncFolderOf(backup);
  if (is_redundant) return {{"removed", backup}};
  return {{"restored", path}};
}
