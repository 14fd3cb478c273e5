// formatDn and compareDns, compared with a model that is written differently.
//
// An input is a name. Where it has a field separator, what is before and after that is compared too.
#include <stddef.h>
#include <string.h>

#include <memory>
#include <string>
#include <vector>

#include "dn_model.h"
#include "fuzz.h"
#include "osutils.h"
#include "platform.h"

namespace {

struct FreeText {
  void operator()(char* text) const { free(text); }
};

void compareFormatted(const std::string& input) {
  // A buffer of the name's exact size, so that the sanitizer reports reads beyond it.
  std::vector<char> name(input.begin(), input.end());
  name.push_back('\0');
  name.resize(strlen(name.data()) + 1);  // a zero byte ends a name
  name.shrink_to_fit();
  const std::vector<char> before = name;

  const std::unique_ptr<char, FreeText> canonical(formatDn(name.data()));

  if (name != before) fail("the caller's name was changed", name.data(), before.data());
  if (name.size() == 1) {
    if (canonical) fail("an empty name has a result", shown(canonical.get()), "none");
    return;
  }
  const std::string expected = modelOfFormattedDn(name.data());
  if (!canonical) fail("no result", "none", shown(expected));
  expectSame("formatDn", canonical.get(), expected);
}

void compareCompared(std::string a, std::string b) {
  a.erase(strlen(a.c_str()));
  b.erase(strlen(b.c_str()));
  const bool expected = !a.empty() && !b.empty() && modelOfFormattedDn(a) == modelOfFormattedDn(b);
  expectSame("compareDns", compareDns(a.data(), b.data()), expected);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string input(reinterpret_cast<const char*>(data), size);
  trcEvents = 0;
  compareFormatted(input);
  const size_t separator = input.find(kFieldSeparator);
  if (separator != std::string::npos) {
    trcEvents = ~uint64_t{0};
    compareCompared(input.substr(0, separator), input.substr(separator + 1));
  }
  return 0;
}
