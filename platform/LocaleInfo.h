#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Runtime.h"

namespace sable::platform {

inline constexpr std::string_view kCurrentLocaleDidChangeNotification = "CurrentLocaleDidChange";
inline constexpr std::string_view kSystemTimeZoneDidChangeNotification = "SystemTimeZoneDidChange";

/// The current locale and what the user prefers. Each answer is worked out when asked for; changes
/// are posted on the notification centre under the names above.
class LocaleInfo {
 public:
  virtual ~LocaleInfo() = default;
  virtual std::string localeIdentifier() const = 0;    ///< "en_GB"
  virtual std::string calendarIdentifier() const = 0;  ///< "gregorian", "buddhist" (CLDR names)
  virtual std::string measurementSystem() const = 0;   ///< "Metric", "U.S.", "U.K."
  /// "Celsius" or "Fahrenheit": the user's preference, else what the locale uses.
  virtual std::optional<std::string> temperatureUnit() const = 0;
  virtual std::vector<std::string> preferredLanguages() const = 0;  ///< BCP 47, best first
  virtual std::string systemLanguage() const = 0;  ///< the system's localisation that fits them best
  /// The date pattern for the skeleton "j": hours as this locale writes them (UTS 35).
  virtual std::string hourPattern() const = 0;
  virtual std::string timeZoneName() const = 0;  ///< "Europe/London"
  /// The day of a time in the current time zone, counted from 1970-01-01. Days begin at midnight in
  /// every calendar, so two times are of one day of the user's calendar where this is the same. May
  /// read the zone from the disk.
  virtual std::int64_t dayNumber(WallTime time) const = 0;
};

}  // namespace sable::platform
