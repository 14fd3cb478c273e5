// The difference between two texts.
#pragma once

#include <string>

// The unified diff, as `diff -u` prints it; "" if the texts are equal.
std::string unifiedDiff(const std::string& before_name, const std::string& before,
                        const std::string& after_name, const std::string& after);
