#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable {

/// `text` with ASCII letters in lower case; other bytes stay.
std::string lowercasedASCII(std::string_view text);

/// The first of kSBLClientNames that `text` contains in any letter case ("rover", "beacon", ...).
std::optional<std::string_view> extractClientNameFromString(std::string_view text);

/// "rover" or "beacon", whichever the user agent names first in this order, else "unknown".
std::string_view getClientFromUserAgent(const std::optional<std::string>& userAgent);

/// Key of a per-client counter: "com.kestrel.sabled.FIRST.SECOND".
std::string createTallyKey(std::string_view first, std::string_view second);

}  // namespace sable
