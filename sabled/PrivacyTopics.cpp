#include "sabled/PrivacyTopics.h"

#include <algorithm>
#include <array>

namespace sable {
namespace {

constexpr std::array kTopics{
    PrivacyTopic{"_addHttpRequestUserGuid", "random identifier", "ties the queries of 15 minutes together",
                 "renews itself, also between sessions"},
    PrivacyTopic{"_addHttpRequestUserAgent", "device, system, client", "results and images that fit",
                 "facts product_type, product_name, build_version; the client's agent"},
    PrivacyTopic{"_addLocationQueryItem", "location, to 6 to 12 km", "results nearby",
                 "off by the fact location (authorization = 2), by GeoClue's agent, or by the bag"},
    PrivacyTopic{"_addLocationSourceQueryItem", "source of the location, or why none", "weighing it",
                 "follows the location"},
    PrivacyTopic{"_addHttpFuzzedLocation", "location at the last search, likewise", "files of the region",
                 "follows the location"},
    PrivacyTopic{"_addHttpAppWhitelistSignature", "signature of installed applications",
                 "results that can be opened", "applications that the service's list names"},
    PrivacyTopic{"_addHttpRequestSubscriptionInfo", "subscriptions", "results that can be played",
                 "fact subscriptions, of providers that the bag names"},
    PrivacyTopic{"_addLocaleQueryItem", "locale", "the conventions of results", "fact locale"},
    PrivacyTopic{"_addHttpRequestPreferredLanguages", "preferred languages, up to three",
                 "the languages of results", "fact preferred_languages"},
    PrivacyTopic{"_addEffectiveSystemLanguageQueryItem", "system's language", "the language of labels",
                 "fact system_language"},
    PrivacyTopic{"_addKeyboardInputModeQueryItem", "keyboard", "correcting what is typed",
                 "fact keyboard_input_mode"},
    PrivacyTopic{"_addDeviceCountryCodeQueryItem", "country", "what is offered there", "fact country_code"},
    PrivacyTopic{"_addTimeZoneQueryItem", "time zone", "times in results", "fact time_zone"},
    PrivacyTopic{"_addCalendarQueryItem", "calendar", "dates in results", "fact calendar"},
    PrivacyTopic{"_addTemperatureUnitsQueryItem", "measurement system", "units in results",
                 "fact measurement_system"},
    PrivacyTopic{"_addTempUnitPreferenceQueryItem", "temperature unit", "units in results",
                 "fact temperature_unit"},
    PrivacyTopic{"_add24hDateFormatQueryItem", "24-hour clock", "times in results", "fact hour_cycle_24"},
    PrivacyTopic{"_addHttpRequestUIScale", "scale of the screen", "images that fit", "fact screen_scale"},
    PrivacyTopic{"_addManagedAccountQueryItem", "managed account or restrictions", "results that are allowed",
                 "facts managed_account, bookstore_, media_store_, app_installation_allowed"},
    PrivacyTopic{"_addStoreFrontQueryItem", "store front", "offers of the store", "fact storefront"},
    PrivacyTopic{"_addHttpRequestMapsSessionId", "session of maps", "finding the same place again in maps",
                 "fact geo_session_id"},
    PrivacyTopic{"_addHttpMapsEnvironmentName", "environment of maps", "the maps service that is meant",
                 "fact geo_environment, where the bag asks for it"},
    PrivacyTopic{"_addHttpGeoClientMetadata", "metadata of maps", "maps in results", "fact geo_metadata"},
    PrivacyTopic{"_addDiagnosticsAndUsageQueryItem", "that diagnostics are allowed", "what may be kept",
                 "fact diagnostics_allowed"},
    PrivacyTopic{"_addBrambleQueryItem", "use of the privacy proxy", "a bag that names one",
                 "setting SBLUseBramble"},
    PrivacyTopic{"_addDebugQueryItems", "debug parameter", "development", "setting SBLDebugParameters"},
    // Nothing of the device.
    PrivacyTopic{"URL", "", "", ""},
    PrivacyTopic{"query", "", "", ""},
    PrivacyTopic{"client's items", "", "", ""},
    PrivacyTopic{"_addSecretKeyQueryItem", "", "", ""},
    PrivacyTopic{"_addVersionQueryItem", "", "", ""},
    PrivacyTopic{"_addCardQueryItem", "", "", ""},
    PrivacyTopic{"_addHttpRequestTopTopics", "", "", ""},
    PrivacyTopic{"_addHttpIfNoneMatch", "", "", ""},
    PrivacyTopic{"_addQueryLanguageQueryItem", "", "", ""},
    PrivacyTopic{"_addLookupContextLanguageQueryItem", "", "", ""},
    PrivacyTopic{"_addLookupHintDomainQueryItem", "", "", ""},
    PrivacyTopic{"_addClientContextQueryItem", "", "", ""},
    PrivacyTopic{"_addLookupSelectionType", "", "", ""},
};

}  // namespace

PrivacyTopic privacyTopic(std::string_view step) {
  const auto found = std::ranges::find(kTopics, step, &PrivacyTopic::step);
  PrivacyTopic topic = found == kTopics.end() ? PrivacyTopic{step, step, "", ""} : *found;
  topic.order = static_cast<std::size_t>(found - kTopics.begin());
  return topic;
}

}  // namespace sable
