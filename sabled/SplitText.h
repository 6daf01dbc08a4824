#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace sable {

/// The pieces of a text between separators; one more than there are separators, some may be empty.
inline std::vector<std::string> split(std::string_view text, char separator) {
  std::vector<std::string> pieces;
  for (std::size_t start = 0;;) {
    const std::size_t end = text.find(separator, start);
    pieces.emplace_back(text.substr(start, end - start));
    if (end == std::string_view::npos) return pieces;
    start = end + 1;
  }
}

}  // namespace sable
