// What libbabeltrace2 may do to the process over a bad trace.
#pragma once

#include <stddef.h>
#include <sys/resource.h>

#include <functional>

#include "folders.h"

namespace traces {

// Until the end of the scope, a crash, or one of the limits below, ends the process with a line that names the folder
// and with status 3: libbabeltrace2 may abort over metadata. These and other signals that end the process remove the
// PartOfFolder that there is.
class Guard {
 public:
  explicit Guard(const std::string& folder);
  ~Guard();
  Guard(const Guard&) = delete;
  Guard& operator=(const Guard&) = delete;
};

// Makes calls with 0, 1, ... in a child process. Returns the number of them before a crash, or one of the limits below,
// ended it; all of them if there can be no child process.
size_t callsSurvived(size_t calls, const std::function<void(size_t)>& function);

// Bounds of processor time and memory while libbabeltrace2 looks for the packets of a folder, which has no end for a
// packet of size 0. Many times what a good trace needs.
class Limits {
 public:
  explicit Limits(const Folder& folder);
  ~Limits();
  Limits(const Limits&) = delete;
  Limits& operator=(const Limits&) = delete;

 private:
  rlimit memory_ = {};
};

}  // namespace traces
