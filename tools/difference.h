// What would change in a file, or would come back to it, for people and for patch.
#pragma once

#include <string>

// The unified difference between two texts, as `diff -u` writes it; "" when they are the same.
std::string unifiedDiff(const std::string& before_name, const std::string& before,
                        const std::string& after_name, const std::string& after);
