#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable::platform {

/// The numeric text of an address of 4 bytes (IPv4) or 16 (IPv6, RFC 5952) in network order; empty
/// for any other number of bytes.
std::string numericAddress(std::string_view bytes);

/// The 4 or 16 bytes of a numeric address without brackets, port or zone; nullopt for other text.
std::optional<std::string> addressBytes(const std::string& text);

}  // namespace sable::platform
