// Keeps tracing and printing from changing their caller's errno.
#pragma once

#include <errno.h>

namespace osutils {

// Restores errno at the end of the scope, or earlier on request.
class ErrnoSaver {
 public:
  ErrnoSaver() : saved_(errno) {}
  ~ErrnoSaver() { restore(); }
  ErrnoSaver(const ErrnoSaver&) = delete;
  ErrnoSaver& operator=(const ErrnoSaver&) = delete;

  void restore() const { errno = saved_; }

 private:
  int saved_;
};

}  // namespace osutils
