// The folders of traces below the paths of a command line.
#pragma once

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

namespace traces {

struct Folder {
  std::string path;
  std::pair<uint64_t, uint64_t> id;  // device and inode
  std::vector<std::string> files;    // with records
  uint64_t bytes = 0;                // of these
  uint64_t metadata_bytes = 0;
};

struct Folders {
  std::vector<Folder> folders;  // sorted by path
  std::vector<std::string> problems;
};

// Finds the folders with a file "metadata", each once whatever names lead to it. Links to directories below the paths
// are not followed.
Folders findFolders(const std::vector<std::string>& paths);

// A temporary folder with links to some files of a trace, because libbabeltrace2 refuses a whole folder for one bad
// file. There is one at a time.
class PartOfFolder {
 public:
  PartOfFolder(const Folder& folder, const std::vector<std::string>& files);
  ~PartOfFolder() { remove(); }
  PartOfFolder(const PartOfFolder&) = delete;
  PartOfFolder& operator=(const PartOfFolder&) = delete;

  const std::string& path() const { return path_; }
  // Removes the folder if there is one, for a handler of signals that ends the process.
  static void removePresent();

 private:
  void remove() const;

  std::string path_;
  std::vector<std::string> links_;
};

}  // namespace traces
