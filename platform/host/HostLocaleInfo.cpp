#include "platform/host/HostLocaleInfo.h"

#include "platform/host/LocaleConventions.h"
#include "platform/host/LocaleNames.h"
#include "platform/host/TimeZones.h"

namespace sable::platform::host {

std::string HostLocaleInfo::localeIdentifier() const {
  return facts_.localeIdentifier();
}

std::string HostLocaleInfo::calendarIdentifier() const {
  if (auto fact = facts_.string("calendar")) return *fact;
  return calendarOf(localeIdentifier());
}

std::string HostLocaleInfo::measurementSystem() const {
  if (auto fact = facts_.string("measurement_system")) return *fact;
  return measurementSystemOf(localeIdentifier());
}

std::optional<std::string> HostLocaleInfo::temperatureUnit() const {
  if (auto fact = facts_.string("temperature_unit")) return fact;
  return temperatureUnitOf(localeIdentifier());
}

std::vector<std::string> HostLocaleInfo::preferredLanguages() const {
  if (auto fact = facts_.strings("preferred_languages")) return *fact;
  if (auto locale = facts_.string("locale")) return {languageTag(*locale)};
  return languagesOfHost(facts_.sources().environment);
}

std::string HostLocaleInfo::systemLanguage() const {
  if (auto fact = facts_.string("system_language")) return *fact;
  const auto languages = preferredLanguages();
  return languages.empty() ? "en" : languages.front();
}

std::string HostLocaleInfo::hourPattern() const {
  const auto wish = facts_.boolean("hour_cycle_24");
  return hourPatternOf(wish ? withHourCycle(localeIdentifier(), *wish) : localeIdentifier());
}

std::string HostLocaleInfo::timeZoneName() const {
  return facts_.timeZoneName();
}

std::int64_t HostLocaleInfo::dayNumber(WallTime time) const {
  const WallTime local = time + utcOffsetOf(timeZoneName(), time);
  return std::chrono::floor<std::chrono::days>(local).time_since_epoch().count();
}

}  // namespace sable::platform::host
