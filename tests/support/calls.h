// The records that calls leave, as Records::trail() gives them.
#pragma once

#include <string>
#include <vector>

using Trail = std::vector<std::string>;

template <typename... Parts>
Trail joined(const Parts&... parts) {
  Trail all;
  (all.insert(all.end(), parts.begin(), parts.end()), ...);
  return all;
}

// A call with what happened inside it.
template <typename... Inner>
Trail call(const std::string& name, long code, const Inner&... inner) {
  const std::string exit = code == 0 ? "< " : "<! ";
  return joined(Trail{"> " + name}, inner..., Trail{exit + name + " " + std::to_string(code)});
}
inline Trail yes(const std::string& name) { return call(name, 1); }
inline Trail no(const std::string& name) { return call(name, 0); }
