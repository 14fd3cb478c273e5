// Models what a disk holds after a power failure in the middle of an edit.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "faults.h"

// The files of a test on the disk. Steps that were not forced to the disk may be lost.
class PoweredDisk {
 public:
  explicit PoweredDisk(std::map<std::string, std::string> files) : contents_(std::move(files)) {
    for (const auto& [path, data] : contents_) named_[path] = true;
  }

  void apply(const FileStep& step) {
    switch (step.kind) {
      case FileStep::kFlushed:
        for (FileStep& waiting : pending_) {
          if (waiting.kind == FileStep::kBuffered && waiting.path == step.path) {
            waiting.kind = FileStep::kWritten;
          }
        }
        break;
      case FileStep::kForced:
        settle([&](const FileStep& waiting) {
          const bool is_name =
              waiting.kind == FileStep::kMade || waiting.kind == FileStep::kRemoved;
          return (is_name ? folderOf(waiting.path) : waiting.path) == step.path;
        });
        break;
      case FileStep::kForcedAll:
        settle([](const FileStep&) { return true; });
        break;
      default:
        // Each line of a write may be lost by itself.
        for (size_t begin = 0;;) {
          const size_t newline = step.data.find('\n', begin);
          const size_t end = newline == std::string::npos ? step.data.size() : newline + 1;
          pending_.push_back({step.kind, step.path, step.offset + static_cast<off64_t>(begin),
                              step.data.substr(begin, end - begin)});
          begin = end;
          if (begin >= step.data.size()) break;
        }
    }
  }

  // The number of subsets of the steps that may be lost.
  size_t losses() const { return size_t{1} << pending_.size(); }
  // The files after the loss of one such subset; 0 loses nothing. Only files whose names are on the disk.
  std::map<std::string, std::string> after(size_t loss) const {
    PoweredDisk left = *this;
    for (size_t i = 0; i < pending_.size(); ++i) {
      if ((loss >> i & 1) == 0) left.perform(pending_[i]);
    }
    std::map<std::string, std::string> files;
    for (const auto& [path, is_there] : left.named_) {
      if (is_there) files[path] = left.contents_[path];
    }
    return files;
  }

 private:
  static std::string folderOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

  void perform(const FileStep& step) {
    std::string& data = contents_[step.path];
    const auto offset = static_cast<size_t>(step.offset);
    switch (step.kind) {
      case FileStep::kMade:
        named_[step.path] = true;
        break;
      case FileStep::kRemoved:
        named_[step.path] = false;
        break;
      case FileStep::kCut:
        data.resize(offset);
        break;
      default:
        if (data.size() < offset + step.data.size()) data.resize(offset + step.data.size());
        data.replace(offset, step.data.size(), step.data);
    }
  }

  template <typename IsForced>
  void settle(IsForced is_forced) {
    std::vector<FileStep> waiting;
    for (const FileStep& step : pending_) {
      if (step.kind != FileStep::kBuffered && is_forced(step)) {
        perform(step);
      } else {
        waiting.push_back(step);
      }
    }
    pending_ = std::move(waiting);
  }

  std::map<std::string, std::string> contents_;  // also of files whose names are not on the disk
  std::map<std::string, bool> named_;
  std::vector<FileStep> pending_;
};

inline bool holdsLines(const std::string& contents, const std::vector<std::string>& lines) {
  for (const std::string& line : lines) {
    const size_t at = contents.find(line);
    if (at == std::string::npos || (at != 0 && contents[at - 1] != '\n')) return false;
  }
  return true;
}

// Checks the disk after each step and each possible loss. Returns an empty string if one of the files
// always has all the lines, else a description of the loss. `now` is the state of the files at the end.
inline std::string lostLines(const std::vector<FileStep>& steps,
                             const std::map<std::string, std::string>& files,
                             const std::map<std::string, std::string>& now,
                             const std::vector<std::string>& lines) {
  PoweredDisk disk(files);
  for (size_t done = 0;; ++done) {
    for (size_t loss = 0; loss < disk.losses(); ++loss) {
      bool held = false;
      std::string found;
      for (const auto& [path, data] : disk.after(loss)) {
        held = held || holdsLines(data, lines);
        found += "\n" + path + ":\n" + data;
      }
      if (!held) return "after " + std::to_string(done) + " steps:" + found;
    }
    if (done == steps.size()) break;
    disk.apply(steps[done]);
  }
  if (disk.after(0) != now) return "the steps do not tell how the files came about";
  return "";
}
