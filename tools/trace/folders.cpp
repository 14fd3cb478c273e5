#include "folders.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <set>
#include <system_error>

namespace traces {
namespace {

namespace fs = std::filesystem;

std::atomic<const PartOfFolder*> present = nullptr;

// Adds the folder if it is a trace, and those below it.
void addFolder(const fs::path& path, Folders& found) {
  std::vector<fs::path> below;
  Folder folder{path.string(), {}, {}, 0, 0};
  bool has_metadata = false;
  std::error_code error;
  for (fs::directory_iterator entry(path, error), end; !error && entry != end;
       entry.increment(error)) {
    const std::string name = entry->path().filename().string();
    std::error_code failed;
    if (name.starts_with('.')) continue;
    if (entry->is_directory(failed) && !entry->is_symlink(failed)) {
      below.push_back(entry->path());
    } else if (entry->is_regular_file(failed)) {
      const uintmax_t size = entry->file_size(failed);
      if (name == "metadata") {
        has_metadata = true;
        if (!failed) folder.metadata_bytes = size;
      } else {
        folder.files.push_back(name);
        if (!failed) folder.bytes += size;
      }
    }
  }
  if (error) {
    found.problems.push_back(path.string() + ": " + error.message());
    return;
  }
  if (has_metadata) {
    struct stat status = {};
    if (stat(path.c_str(), &status) != 0) {
      found.problems.push_back(path.string() + ": " + strerror(errno));
      return;
    }
    folder.id = {status.st_dev, status.st_ino};
    found.folders.push_back(std::move(folder));
  }
  for (const fs::path& each : below) addFolder(each, found);
}

}  // namespace

Folders findFolders(const std::vector<std::string>& paths) {
  Folders found;
  for (const std::string& path : paths) {
    const size_t before = found.folders.size() + found.problems.size();
    addFolder(path, found);
    if (found.folders.size() + found.problems.size() == before) {
      found.problems.push_back(path + ": there is no trace here or below");
    }
  }
  const auto by_path = [](const Folder& a, const Folder& b) { return a.path < b.path; };
  std::sort(found.folders.begin(), found.folders.end(), by_path);
  std::set<std::pair<uint64_t, uint64_t>> ids;
  std::erase_if(found.folders,
                [&ids](const Folder& folder) { return !ids.insert(folder.id).second; });
  return found;
}

PartOfFolder::PartOfFolder(const Folder& folder, const std::vector<std::string>& files)
    : path_((fs::temp_directory_path() / "osutils-trace-XXXXXX").string()) {
  const fs::path original = fs::absolute(folder.path);
  links_.push_back(path_ + "/metadata");
  for (const std::string& file : files) links_.push_back(path_ + '/' + file);
  present = this;  // before there is anything to remove
  if (mkdtemp(path_.data()) == nullptr) {
    present = nullptr;
    throw std::system_error(errno, std::generic_category(), "cannot make " + path_);
  }
  for (std::string& link : links_) link.replace(0, path_.size(), path_);
  try {
    for (const fs::path link : links_) fs::create_symlink(original / link.filename(), link);
  } catch (...) {
    remove();
    throw;
  }
}

// Needs no memory, and only calls that a handler of signals may make.
void PartOfFolder::remove() const {
  for (const std::string& link : links_) (void)unlink(link.c_str());
  (void)rmdir(path_.c_str());
  present = nullptr;
}

void PartOfFolder::removePresent() {
  if (const PartOfFolder* const part = present) part->remove();
}

}  // namespace traces
