// Owners of C resources, which they release at the end of the scope unless release() was called.
#pragma once

#include <stdio.h>
#include <stdlib.h>

#include <memory>

namespace osutils {

struct FreeDeleter {
  void operator()(void* memory) const noexcept { free(memory); }
};
using OwnedString = std::unique_ptr<char, FreeDeleter>;

// A list that ends in a null entry, with its entries.
struct ListDeleter {
  void operator()(char** list) const noexcept {
    for (char** entry = list; *entry != nullptr; ++entry) free(*entry);
    free(static_cast<void*>(list));
  }
};
using OwnedList = std::unique_ptr<char*, ListDeleter>;

struct CloseDeleter {
  void operator()(FILE* stream) const noexcept { (void)fclose(stream); }
};
using OwnedStream = std::unique_ptr<FILE, CloseDeleter>;

}  // namespace osutils
