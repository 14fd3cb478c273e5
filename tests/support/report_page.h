// The pages of trace report.
#pragma once

#include <string>

// With a fixed word for the random one that permits the page's scripts.
inline std::string withoutNonce(std::string page) {
  const std::string mark = "'nonce-";
  const size_t mark_begin = page.find(mark);
  if (mark_begin == std::string::npos) return page;
  const size_t begin = mark_begin + mark.size();
  const std::string nonce = page.substr(begin, page.find('\'', begin) - begin);
  if (nonce.empty()) return page;
  const std::string fixed = "NONCE";
  for (size_t at = 0; (at = page.find(nonce, at)) != std::string::npos; at += fixed.size()) {
    page.replace(at, nonce.size(), fixed);
  }
  return page;
}

// Whether it is whole.
inline bool isPage(const std::string& text) { return text.ends_with("</html>\n"); }

// Whether it says that something is missing in it.
inline bool isPageWithNotes(const std::string& text) {
  return isPage(text) && text.find("\"notes\":[\"") != std::string::npos;
}
