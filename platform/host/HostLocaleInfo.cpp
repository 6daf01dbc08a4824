#include "platform/host/HostLocaleInfo.h"

#include <unicode/calendar.h>
#include <unicode/dtptngen.h>
#include <unicode/locid.h>
#include <unicode/measunit.h>
#include <unicode/numberformatter.h>
#include <unicode/ulocdata.h>

#include <memory>

#include "platform/host/LocaleNames.h"

namespace sable::platform::host {

namespace {

/// The value of a Unicode locale keyword ("ms", "mu"); "" when the locale has none.
std::string keyword(const icu::Locale& locale, const char* name) {
  UErrorCode status = U_ZERO_ERROR;
  std::string value = locale.getUnicodeKeywordValue<std::string>(name, status);
  return U_SUCCESS(status) ? value : "";
}

std::string calendarOf(const icu::Locale& locale) {
  UErrorCode status = U_ZERO_ERROR;
  // The zone does not matter, but without one ICU looks for the host's.
  const std::unique_ptr<icu::Calendar> calendar(
      icu::Calendar::createInstance(icu::TimeZone::getGMT()->clone(), locale, status));
  return U_SUCCESS(status) ? calendar->getType() : "gregorian";
}

std::string measurementSystemOf(const icu::Locale& locale) {
  const std::string wish = keyword(locale, "ms");  // which ulocdata does not look at
  if (wish == "metric") return "Metric";
  if (wish == "ussystem") return "U.S.";
  if (wish == "uksystem") return "U.K.";
  UErrorCode status = U_ZERO_ERROR;
  switch (ulocdata_getMeasurementSystem(locale.getName(), &status)) {
    case UMS_US:
      return "U.S.";
    case UMS_UK:
      return "U.K.";
    default:
      return "Metric";
  }
}

std::string temperatureUnitOf(const icu::Locale& locale) {
  const std::string wish = keyword(locale, "mu");
  if (wish == "celsius") return "Celsius";
  if (wish == "fahrenhe") return "Fahrenheit";
  UErrorCode status = U_ZERO_ERROR;
  const auto formatted = icu::number::NumberFormatter::withLocale(locale)
                             .unit(icu::MeasureUnit::getCelsius())
                             .usage("weather")
                             .formatDouble(20, status);
  if (U_FAILURE(status)) return "Celsius";
  const bool fahrenheit = formatted.getOutputUnit(status) == icu::MeasureUnit::getFahrenheit();
  return U_SUCCESS(status) && fahrenheit ? "Fahrenheit" : "Celsius";
}

std::string hourPatternOf(const icu::Locale& locale) {
  UErrorCode status = U_ZERO_ERROR;
  const std::unique_ptr<icu::DateTimePatternGenerator> generator(
      icu::DateTimePatternGenerator::createInstance(locale, status));
  if (U_FAILURE(status)) return "HH";
  std::string pattern;
  generator->getBestPattern("j", status).toUTF8String(pattern);
  return U_SUCCESS(status) ? pattern : "HH";
}

}  // namespace

std::string HostLocaleInfo::localeIdentifier() const {
  return facts_.localeIdentifier();
}

std::string HostLocaleInfo::calendarIdentifier() const {
  if (auto fact = facts_.string("calendar")) return *fact;
  return calendarOf(icu::Locale(localeIdentifier().c_str()));
}

std::string HostLocaleInfo::measurementSystem() const {
  if (auto fact = facts_.string("measurement_system")) return *fact;
  return measurementSystemOf(icu::Locale(localeIdentifier().c_str()));
}

std::optional<std::string> HostLocaleInfo::temperatureUnit() const {
  if (auto fact = facts_.string("temperature_unit")) return fact;
  return temperatureUnitOf(icu::Locale(localeIdentifier().c_str()));
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
  icu::Locale locale(localeIdentifier().c_str());
  if (const auto wish = facts_.boolean("hour_cycle_24")) {
    UErrorCode status = U_ZERO_ERROR;
    locale.setUnicodeKeywordValue("hc", *wish ? "h23" : "h12", status);
  }
  const std::lock_guard lock(mutex_);
  if (hourPattern_.first != locale.getName()) hourPattern_ = {locale.getName(), hourPatternOf(locale)};
  return hourPattern_.second;
}

std::string HostLocaleInfo::timeZoneName() const {
  return facts_.timeZoneName();
}

}  // namespace sable::platform::host
