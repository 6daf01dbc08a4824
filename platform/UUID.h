#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace sable {

/// A 128-bit identifier, RFC 4122 version 4 when it comes from Runtime::uuid().
struct UUID {
  std::array<std::uint8_t, 16> bytes{};

  /// Canonical text in upper case: "F81D4FAE-7DEC-41D0-A765-00A0C91E6BF6".
  std::string string() const;

  /// Reads canonical text in either letter case; anything else is nullopt.
  static std::optional<UUID> parse(std::string_view text);

  friend bool operator==(const UUID&, const UUID&) = default;
};

}  // namespace sable
