#pragma once

#include <cstddef>
#include <string_view>

namespace sable {

/// Length of UTF-8 text in UTF-16 code units, in which the service counts. A character beyond the
/// Basic Multilingual Plane is two.
constexpr std::size_t lengthInUTF16(std::string_view utf8) {
  std::size_t length = 0;
  for (const char c : utf8) {
    const auto byte = static_cast<unsigned char>(c);
    const bool continues = (byte & 0xC0) == 0x80;
    if (!continues) length += byte >= 0xF0 ? 2 : 1;
  }
  return length;
}

}  // namespace sable
