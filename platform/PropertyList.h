#pragma once

#include <string>
#include <string_view>

#include "platform/Dictionary.h"

namespace sable::platform {

/// Binary property lists ("bplist00"). JSON null has no counterpart there: such members are left
/// out of objects and arrays. 64-bit integers, doubles, booleans, strings, arrays and objects make
/// the round trip exactly; dates and data read as numbers (seconds since 1970) and base64 strings.
Expected<std::string> encodePropertyList(const Dictionary& value);
Expected<Dictionary> decodePropertyList(std::string_view bytes);

}  // namespace sable::platform
