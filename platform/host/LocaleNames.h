#pragma once

#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

#include "platform/host/Folders.h"

/// What the host says about locale, languages and time zone, as plain strings: nothing here loads
/// locale data.
namespace sable::platform::host {

/// The first of LC_ALL, LC_MESSAGES and LANG that is set (POSIX.1-2017 section 8.2), without
/// encoding: "en_GB"; a script modifier in its place: "sr_Latn_RS". "en_US" for the C locale.
std::string localeIdentifierOfHost(const Environment& environment);

/// LANGUAGE in its order, then the locale's, as BCP 47 tags without repetition.
std::vector<std::string> languagesOfHost(const Environment& environment);

/// "en_GB@calendar=x" -> "en-GB".
std::string languageTag(std::string_view localeIdentifier);
/// ISO 639 code in lower case: "en".
std::string languageOf(std::string_view localeIdentifier);
/// ISO 3166-1 alpha-2 code in upper case: "GB"; "" when the locale has none.
std::string regionOf(std::string_view localeIdentifier);

/// The tz database's name: TZ, else what /etc/localtime links to, else what /etc/timezone says,
/// else "UTC". `root` is "/".
std::string timeZoneOfHost(const Environment& environment, const std::filesystem::path& root);

}  // namespace sable::platform::host
