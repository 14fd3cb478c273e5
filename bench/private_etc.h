// Another /etc for this process alone.
#pragma once

#include <string>

// Writes `content` to /etc/`name` as this process alone sees it. The first call gives the calling
// thread an /etc of its own, which is empty. Returns an empty string, or why it failed.
std::string writeToPrivateEtc(const std::string& name, const std::string& content);
