// The folders of traces below the paths of a command line.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

namespace traces {

struct Folder {
  std::string path;
  uint64_t files = 0;  // with records
};

struct Folders {
  std::vector<Folder> folders;  // sorted by name
  std::vector<std::string> problems;
};

// Finds the folders with a file "metadata". Links to directories below the paths are not followed.
Folders findFolders(const std::vector<std::string>& paths);

}  // namespace traces
