// Surroundings in which calls of the operating system really fail, in private namespaces.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace surroundings {

// The small file system on which everything is that a run works on.
struct Disk {
  std::string path;
  std::string work;    // for the run; owned by the user of the surrounding
  std::string traces;  // does not exist
};

struct Surrounding {
  std::string name;
  // Called by the process that is to be surrounded, after everything is prepared. Allocates nothing
  // that stays.
  std::function<void(const Disk&)> enter;
  // Whether the surrounding has its effect.
  std::function<bool(const Disk&)> holds;
  // Makes the results of a run readable again. Works in another process than enter() too.
  std::function<void(const Disk&)> leave = [](const Disk&) {};
  uid_t user = 0;
  unsigned closed = 0;           // the standard descriptors that enter() closes, as bits
  bool limits_memory = false;    // to what the process has
  bool few_descriptors = false;  // tracing and messages may take the last ones
  bool ends_writers = false;     // with SIGXFSZ
  bool is_remembered = false;    // by the C library, after leave() too
};

std::vector<Surrounding> all();

// A new process namespace with a file system for each surrounding, an /etc, a network and a host name
// of its own. Runs the body in it and returns its result, as inChild() does. Needs root.
int withDisk(const std::function<int(const Disk&)>& body);

// Empties the disk and makes the directory for a run.
void clear(const Disk& disk);
// Lets the user of the surrounding make and remove files.
void handOver(const Surrounding& surrounding, const Disk& disk);

// The files that the program has opened as its standard descriptors.
class StandardFiles {
 public:
  // In this directory, which is not on the disk.
  explicit StandardFiles(std::string directory);
  // Opens them in this process as descriptors 0, 1 and 2. Returns false if it cannot.
  bool open() const;
  // What was done to them, empty if nothing. In the process that opened them.
  std::string changes(bool may_print_errors) const;

 private:
  std::string directory_;
};

}  // namespace surroundings
