#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Dictionary.h"

namespace sable::platform {

inline constexpr std::string_view kPropertyListErrorDomain = "PropertyListErrorDomain";
enum class PropertyListErrorCode : std::int64_t { notEncodable = 1, malformed = 2, tooLarge = 3 };

/// Property lists of more bytes are neither written nor read, nor are such read as unfold to more
/// than eight times as much (one string may stand in many places).
inline constexpr std::size_t kMaximumPropertyListBytes = 8u << 20;

/// Writes a binary property list ("bplist00"). JSON null has no counterpart there: such members are
/// left out of objects and arrays, and null alone is not encodable, nor is a string that is not
/// UTF-8, nor nesting beyond kMaximumJSONDepth. Everything else makes the round trip exactly, 64-bit
/// integers of either sign, doubles and the order of members included.
Expected<std::string> encodePropertyList(const Dictionary& value);

/// Reads any bytes safely. Dates read as numbers (seconds since 1970), data as base64 strings
/// (RFC 4648 section 4), UIDs as integers.
///
///     offset        bytes  content
///     0             8      "bplist00"
///     8             ...    objects: marker byte (kind << 4 | size), then the payload
///     table         n * o  offset of each object, big endian
///     end - 32      6      unused, sort version
///     end - 26      1      o, bytes per offset
///     end - 25      1      r, bytes per object reference
///     end - 24      8      n, number of objects
///     end - 16      8      index of the root object
///     end - 8       8      offset of the table
Expected<Dictionary> decodePropertyList(std::string_view bytes);

}  // namespace sable::platform
