// Small text helpers shared by the benchmark programs' command lines.
#pragma once

#include <sstream>
#include <string>
#include <vector>

namespace telvane::bench {

// The non-empty parts of the text between separators ("1,,4" gives "1" and "4").
inline std::vector<std::string> split(const std::string& text, char separator) {
  std::vector<std::string> parts;
  std::istringstream in(text);
  std::string part;
  while (std::getline(in, part, separator)) {
    if (!part.empty()) parts.push_back(part);
  }
  return parts;
}

}  // namespace telvane::bench
