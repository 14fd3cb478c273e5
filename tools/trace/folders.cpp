#include "folders.h"

#include <algorithm>
#include <filesystem>
#include <system_error>

namespace traces {
namespace {

namespace fs = std::filesystem;

// Adds the folder if it is a trace, and those below it.
void addFolder(const fs::path& path, Folders& found) {
  std::vector<fs::path> below;
  Folder folder{path.string(), 0};
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
      if (name == "metadata") {
        has_metadata = true;
      } else {
        ++folder.files;
      }
    }
  }
  if (error) {
    found.problems.push_back(path.string() + ": " + error.message());
    return;
  }
  if (has_metadata) found.folders.push_back(std::move(folder));
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
  const auto same_path = [](const Folder& a, const Folder& b) { return a.path == b.path; };
  found.folders.erase(std::unique(found.folders.begin(), found.folders.end(), same_path),
                      found.folders.end());
  return found;
}

}  // namespace traces
