#pragma once

#include <string>

/// What CLDR says of a locale's conventions, looked up in ICU's data. ICU's formatters would tell the
/// same, but making one of each keeps 3.6 MiB more of them in memory for good.
/// Identifiers are POSIX ("de_DE@mu=fahrenhe") or BCP 47 with Unicode extensions.
namespace sable::platform::host {

/// "gregorian", "buddhist".
std::string calendarOf(const std::string& localeIdentifier);
/// "Metric", "U.S.", "U.K.".
std::string measurementSystemOf(const std::string& localeIdentifier);
/// "Celsius", "Fahrenheit": of the weather.
std::string temperatureUnitOf(const std::string& localeIdentifier);
/// The pattern of the skeleton "j" (UTS 35 part 4, "Matching Skeletons").
std::string hourPatternOf(const std::string& localeIdentifier);
/// The locale with its hour cycle set.
std::string withHourCycle(const std::string& localeIdentifier, bool has24Hours);

}  // namespace sable::platform::host
