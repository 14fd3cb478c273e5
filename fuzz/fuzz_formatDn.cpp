// formatDn, compared with a model that is written differently.
#include <stddef.h>
#include <string.h>

#include <memory>
#include <string>
#include <vector>

#include "dn_model.h"
#include "fuzz.h"
#include "osutils.h"

namespace {

struct FreeText {
  void operator()(char* text) const { free(text); }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // A buffer of the name's exact size, so that the sanitizer reports reads beyond it.
  std::vector<char> name(data, data + size);
  name.push_back('\0');
  name.resize(strlen(name.data()) + 1);  // a zero byte ends a name
  name.shrink_to_fit();
  const std::vector<char> before = name;

  const std::unique_ptr<char, FreeText> canonical(formatDn(name.data()));

  if (name != before) fail("the caller's name was changed", name.data(), before.data());
  if (name.size() == 1) {
    if (canonical) fail("an empty name has a result", shown(canonical.get()), "none");
    return 0;
  }
  const std::string expected = modelOfFormattedDn(name.data());
  if (!canonical) fail("no result", "none", shown(expected));
  expectSame("formatDn", canonical.get(), expected);
  return 0;
}
