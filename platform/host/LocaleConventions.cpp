#include "platform/host/LocaleConventions.h"

#include <unicode/locid.h>
#include <unicode/uloc.h>
#include <unicode/unistr.h>
#include <unicode/ures.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <initializer_list>
#include <optional>

namespace sable::platform::host {

namespace {

/// A place in a bundle of ICU's data; one that is not there has nothing below it.
class Resource {
 public:
  explicit Resource(const char* bundle) { bundle_.adoptInstead(ures_openDirect(nullptr, bundle, &status_)); }

  Resource at(std::initializer_list<const char*> keys) const {
    Resource place;
    place.status_ = status_;
    const UResourceBundle* from = bundle_.getAlias();
    for (const char* key : keys) {
      UResourceBundle* next = ures_getByKey(from, key, nullptr, &place.status_);
      place.bundle_.adoptInstead(next);
      from = next;
    }
    return place;
  }
  Resource first() const {
    Resource place;
    place.status_ = status_;
    place.bundle_.adoptInstead(ures_getByIndex(bundle_.getAlias(), 0, nullptr, &place.status_));
    return place;
  }

  bool exists() const { return U_SUCCESS(status_); }
  std::optional<std::string> string() const {
    UErrorCode status = status_;
    int32_t length = 0;
    const UChar* text = ures_getString(bundle_.getAlias(), &length, &status);
    if (U_FAILURE(status)) return std::nullopt;
    std::string result;
    return icu::UnicodeString(text, length).toUTF8String(result);
  }
  std::optional<int> integer() const {
    UErrorCode status = status_;
    const int value = ures_getInt(bundle_.getAlias(), &status);
    return U_SUCCESS(status) ? std::optional(value) : std::nullopt;
  }

 private:
  Resource() = default;

  UErrorCode status_ = U_ZERO_ERROR;
  icu::LocalUResourceBundlePointer bundle_;
};

/// The value of a Unicode locale keyword ("ms", "mu"); "" when the locale has none.
std::string keyword(const icu::Locale& locale, const char* name) {
  // Few locales have any, and to look one up ICU builds a table of them all: 3 ms and 230 KiB.
  if (std::strchr(locale.getName(), ULOC_KEYWORD_SEPARATOR) == nullptr) return {};
  UErrorCode status = U_ZERO_ERROR;
  std::string value = locale.getUnicodeKeywordValue<std::string>(name, status);
  return U_SUCCESS(status) ? value : "";
}

/// The region whose conventions the locale follows: the one that "rg" names over the locale's own.
std::string namedRegionOf(const icu::Locale& locale) {
  std::string wish = keyword(locale, "rg");
  if (wish.size() != 6 || !wish.ends_with("zzzz")) return locale.getCountry();
  std::ranges::transform(wish, wish.begin(), [](unsigned char c) { return std::toupper(c); });
  return wish.substr(0, 2);
}

/// Else the one where its language is most at home.
std::string regionOf(icu::Locale locale) {
  if (auto named = namedRegionOf(locale); !named.empty()) return named;
  UErrorCode status = U_ZERO_ERROR;
  locale.addLikelySubtags(status);
  return locale.getCountry();
}

/// What a table of the world's regions has for one of them, or else for the world.
Resource ofRegion(const Resource& table, const std::string& region) {
  Resource own = table.at({region.c_str()});
  return own.exists() ? std::move(own) : table.at({"001"});
}

char hourLetterOf(const icu::Locale& locale) {
  const std::string wish = keyword(locale, "hc");
  if (wish == "h11") return 'K';
  if (wish == "h12") return 'h';
  if (wish == "h23") return 'H';
  if (wish == "h24") return 'k';
  const Resource table = Resource("supplementalData").at({"timeData"});
  const std::string region = regionOf(locale);
  const Resource ofLanguage = table.at({(std::string(locale.getLanguage()) + '_' + region).c_str()});
  const auto preferred =
      (ofLanguage.exists() ? ofLanguage.at({"preferred"}) : ofRegion(table, region).at({"preferred"}))
          .string();
  return preferred && !preferred->empty() ? preferred->front() : 'H';
}

/// The bundle that is most like the locale ("zh_Hant_TW" for "zh_TW"); "root" when none is.
std::string bundleOf(const icu::Locale& locale) {
  UErrorCode status = U_ZERO_ERROR;
  const icu::LocalUResourceBundlePointer bundle(ures_open(nullptr, locale.getBaseName(), &status));
  if (U_FAILURE(status) || status == U_USING_DEFAULT_WARNING) return "root";
  return ures_getLocaleByType(bundle.getAlias(), ULOC_ACTUAL_LOCALE, &status);
}

/// The bundle that a bundle's missing parts are looked for in; root's is none.
std::string parentOf(const std::string& bundle) {
  if (const auto named = Resource(bundle.c_str()).at({"%%Parent"}).string()) return *named;
  if (bundle == "root") return {};
  const auto end = bundle.rfind('_');
  return end == std::string::npos ? "root" : bundle.substr(0, end);
}

}  // namespace

std::string calendarOf(const std::string& localeIdentifier) {
  const icu::Locale locale(localeIdentifier.c_str());
  UErrorCode status = U_ZERO_ERROR;
  auto wish = locale.getKeywordValue<std::string>("calendar", status);
  if (U_SUCCESS(status) && !wish.empty() && Resource("root").at({"calendar", wish.c_str()}).exists())
    return wish;
  return ofRegion(Resource("supplementalData").at({"calendarPreferenceData"}), regionOf(locale))
      .first()
      .string()
      .value_or("gregorian");
}

std::string measurementSystemOf(const std::string& localeIdentifier) {
  const icu::Locale locale(localeIdentifier.c_str());
  const std::string wish = keyword(locale, "ms");
  if (wish == "metric") return "Metric";
  if (wish == "ussystem") return "U.S.";
  if (wish == "uksystem") return "U.K.";
  const Resource table = Resource("supplementalData").at({"measurementData"});
  const auto system = table.at({regionOf(locale).c_str(), "MeasurementSystem"}).integer();
  return system == 1 ? "U.S." : system == 2 ? "U.K." : "Metric";
}

std::string temperatureUnitOf(const std::string& localeIdentifier) {
  const icu::Locale locale(localeIdentifier.c_str());
  const std::string wish = keyword(locale, "mu");
  if (wish == "celsius") return "Celsius";
  if (wish == "fahrenhe") return "Fahrenheit";
  const Resource table = Resource("units").at({"unitPreferenceData", "temperature", "weather"});
  const auto unit = ofRegion(table, namedRegionOf(locale)).first().at({"unit"}).string();
  return unit == "fahrenheit" ? "Fahrenheit" : "Celsius";
}

std::string hourPatternOf(const std::string& localeIdentifier) {
  const icu::Locale locale(localeIdentifier.c_str());
  const char letter = hourLetterOf(locale);
  const char* skeleton = letter == 'h' || letter == 'K' ? "h" : "H";
  // The other calendars have their formats in common.
  const char* calendar = calendarOf(localeIdentifier) == "gregorian" ? "gregorian" : "generic";
  const std::string first = bundleOf(locale);
  for (std::string bundle = first; !bundle.empty(); bundle = parentOf(bundle)) {
    // As ICU's generator has it, root's "HH" is for locales without data; the others just write hours.
    if (bundle == "root" && first != "root" && *skeleton == 'H') break;
    auto pattern = Resource(bundle.c_str()).at({"calendar", calendar, "availableFormats", skeleton}).string();
    if (!pattern) continue;
    // "h" stands for both cycles of twelve hours in the data, "H" for both of 24.
    const auto begin = std::min(pattern->find_first_of("hHkK"), pattern->size());
    const auto end = std::min(pattern->find_first_not_of("hHkK", begin), pattern->size());
    return pattern->replace(begin, end - begin, end - begin, letter);
  }
  return {letter};
}

std::string withHourCycle(const std::string& localeIdentifier, bool has24Hours) {
  icu::Locale locale(localeIdentifier.c_str());
  UErrorCode status = U_ZERO_ERROR;
  locale.setUnicodeKeywordValue("hc", has24Hours ? "h23" : "h12", status);
  return locale.getName();
}

}  // namespace sable::platform::host
