// Another /etc for this process alone.
#pragma once

#include <string>

// Makes `content` the content of /etc/`name`, for this process and for no other one. The first call
// takes the calling thread to an /etc of its own, which holds nothing but such files. Answers an empty
// string, or why it cannot be done.
std::string writeToPrivateEtc(const std::string& name, const std::string& content);
