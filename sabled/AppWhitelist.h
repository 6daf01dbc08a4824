#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace sable {

namespace platform {
class ApplicationRegistry;
}

/// The allow-list is never read beyond this length.
inline constexpr std::size_t kMaximumWhitelistBytes = 8u << 20;

struct AppWhitelistSignature {
  std::string text;                       ///< base64 (RFC 4648 section 4) of what docs/service.md shows
  std::vector<std::string> applications;  ///< the identifiers of those that it tells of, in order
};

/// The signature of the installed applications that an allow-list has. nullopt when none of them is
/// installed, and for a list that is malformed, which is logged. `stream` is the list as the service wrote
/// it:
///
///     {"apps": TEXT, "compression": "RLE", "encoding": "bitmap"}
///     TEXT: {"version": "0a1b", "apps": {BUNDLE-IDENTIFIER: [..., {"encoding_id": N}]}}
///
/// An application counts when it has an identifier and a version, an entry that is built otherwise
/// does not. N is an integer of 0 to 524280, so that the bitmap's length fits into 16 bits; one
/// beyond that, at an installed application, makes the list malformed. Of entries with one name the
/// last counts.
std::optional<AppWhitelistSignature> processWhitelist(std::string_view stream,
                                                      platform::ApplicationRegistry& registry);

/// The signature of a bitmap of `bitmapLength` bytes in the form of `blob` (sabled/RunLengthCode.h).
/// nullopt for a `version` that is not one or more pairs of hexadecimal digits; one of a single pair
/// is as if "00" stood before it.
std::optional<std::string> makeSignature(std::uint16_t bitmapLength, std::span<const std::uint8_t> blob,
                                         bool compressed, std::string_view version);

}  // namespace sable
