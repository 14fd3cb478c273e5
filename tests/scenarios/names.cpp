#include <osutils.h>

#include "scenario.h"

namespace scenarios {

std::vector<Scenario> nameScenarios() {
  return {
      {"formatDn",
       {"formatDn"},
       [] {},
       [] {
         char dn[] = "cn = a ; o = x";
         return freed(formatDn(dn));
       },
       [] { return std::string(); },
       {{kNothing, "\"CN=A,O=X\""}, {kMemory, "null"}}},
  };
}

}  // namespace scenarios
