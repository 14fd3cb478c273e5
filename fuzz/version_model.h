// A model of isVersionValid: one to four groups of digits, between single dots.
#pragma once

#include <algorithm>
#include <string>
#include <vector>

#include "fuzz.h"

inline bool isVersionByModel(const std::string& version) {
  const std::vector<std::string> groups = partsOf(version, '.');
  return groups.size() <= 4 &&
         std::all_of(groups.begin(), groups.end(), [](const std::string& group) {
           return !group.empty() && group.find_first_not_of("0123456789") == std::string::npos;
         });
}
