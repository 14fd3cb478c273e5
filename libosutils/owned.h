// Owners for what the C library hands out: released on every way out, given away with release().
#pragma once

#include <stdio.h>
#include <stdlib.h>

#include <memory>

namespace osutils {

struct FreeDeleter {
  void operator()(void* memory) const noexcept { free(memory); }
};
using OwnedString = std::unique_ptr<char, FreeDeleter>;

struct CloseDeleter {
  void operator()(FILE* stream) const noexcept { (void)fclose(stream); }
};
using OwnedStream = std::unique_ptr<FILE, CloseDeleter>;

}  // namespace osutils
