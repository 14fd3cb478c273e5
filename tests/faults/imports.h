// The functions that shared objects import, and whether they can be made to fail.
#pragma once

#include <set>
#include <string>
#include <vector>

// The undefined symbols of a shared object of this program whose file's name begins with `name`, as
// in the source: without the names that a fortified build gives to functions. Empty if there is none.
std::set<std::string> importsOf(const std::string& name);

// The list in tests/faults/imports.txt. A name there that ends with "*" stands for all that begin so.
struct KnownImports {
  std::set<std::string> failing;
  std::set<std::string> others;
  bool has(const std::string& import) const;
};
KnownImports knownImports();
