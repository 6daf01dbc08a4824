#include <fmt/core.h>

#include <nlohmann/json.hpp>

#include "SableKit/SBLBag.h"
#include "platform/LanguageTagger.h"
#include "platform/LocaleInfo.h"
#include "platform/ManagedConfiguration.h"
#include "sabled/AppWhitelistController.h"
#include "sabled/Assembly.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableLogging.h"
#include "sabled/SableURLRequestBuilder.h"

// The steps of which requests are made. Each adds its one item or header where none of that name
// is yet; only debug items replace what is there.
namespace sable {
namespace {

void addIfPresent(SableURLRequestBuilder& builder, std::string_view name, std::string_view value) {
  if (!value.empty()) builder.defaultQueryItemWithName(name, std::string(value));
}

void addHeaderIfPresent(SableURLRequestBuilder& builder, std::string_view name, std::string_view value) {
  if (!value.empty()) builder.defaultHttpHeaderWithName(name, std::string(value));
}

}  // namespace

void SBLNetworkRequestFactory::beginStep(Builder& builder, const char* name) const {
  contextAccessQueue_->assertIsCurrent();
  builder.beginStep(name);
}

void SBLNetworkRequestFactory::_addSecretKeyQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("key", "tandem4371");
}

void SBLNetworkRequestFactory::_addLocaleQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("locale", context_.localeIdentifier);
}

void SBLNetworkRequestFactory::_addDiagnosticsAndUsageQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  if (assembly_.platform.managedConfiguration().diagnosticsSubmissionAllowed()) {
    builder.defaultQueryItemWithName("du_enabled", "1");
  }
}

void SBLNetworkRequestFactory::_addKeyboardInputModeQueryItem(Builder& builder,
                                                              const SBLRequest& input) const {
  beginStep(builder, __func__);
  if (input.keyboardInputMode) builder.defaultQueryItemWithName("kb_ime", *input.keyboardInputMode);
}

void SBLNetworkRequestFactory::_addTempUnitPreferenceQueryItem(Builder& builder) {
  beginStep(builder, __func__);
  addIfPresent(builder, "temp", conventions().tempUnits);
}

void SBLNetworkRequestFactory::_addQueryLanguageQueryItem(Builder& builder,
                                                          const SBLLookupRequest& input) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "qlang", _languageForString(input.queryString, input.keyboardInputMode));
}

void SBLNetworkRequestFactory::_addLookupContextLanguageQueryItem(Builder& builder,
                                                                  const SBLLookupRequest& input) const {
  beginStep(builder, __func__);
  const std::string context = input.queryContext.value_or("");
  addIfPresent(builder, "lctxlang", _languageForString(context, input.keyboardInputMode));
}

void SBLNetworkRequestFactory::_addLookupHintDomainQueryItem(Builder& builder,
                                                             const SBLLookupRequest& input) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("ldomain", input.domain);
}

void SBLNetworkRequestFactory::_addClientContextQueryItem(Builder& builder,
                                                          const SBLLookupRequest& input) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("context", input.appBundleId);
}

void SBLNetworkRequestFactory::_addLookupSelectionType(Builder& builder,
                                                       const SBLLookupRequest& input) const {
  beginStep(builder, __func__);
  constexpr std::int64_t kExplicit = 1, kHint = 2;
  builder.defaultQueryItemWithName("ltype", input.lookupSelectionType == kExplicit ? "explicit"
                                            : input.lookupSelectionType == kHint   ? "hint"
                                                                                   : "default");
}

void SBLNetworkRequestFactory::_addManagedAccountQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  if (context_.isManagedAccount || context_.deviceRestricted)
    builder.defaultQueryItemWithName("mode", "managed");
}

void SBLNetworkRequestFactory::_addVersionQueryItem(Builder& builder, std::string_view version) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "version", version);
}

void SBLNetworkRequestFactory::_addCardQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("card", "1");
}

void SBLNetworkRequestFactory::_addLocationQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "latlng", context_.geoLocationLatLng);
}

void SBLNetworkRequestFactory::_addLocationSourceQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "geosrc", context_.geoLocationSource);
}

void SBLNetworkRequestFactory::_addAgentQueryItem(Builder& builder, std::string_view userAgent) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "agent", userAgent);
}

void SBLNetworkRequestFactory::_addStoreFrontQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "storefront", context_.storeFrontIdentifier);
}

void SBLNetworkRequestFactory::_addDeviceCountryCodeQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "cc", context_.geoDeviceCountryCode);
}

void SBLNetworkRequestFactory::_addTemperatureUnitsQueryItem(Builder& builder) {
  beginStep(builder, __func__);
  addIfPresent(builder, "units", conventions().localeMeasurementSystem);
}

void SBLNetworkRequestFactory::_add24hDateFormatQueryItem(Builder& builder) {
  beginStep(builder, __func__);
  if (conventions().is24hDateFormat) builder.defaultQueryItemWithName("24h", "1");
}

void SBLNetworkRequestFactory::_addTimeZoneQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "time_zone", context_.localTimeZoneName);
}

void SBLNetworkRequestFactory::_addCalendarQueryItem(Builder& builder) {
  beginStep(builder, __func__);
  addIfPresent(builder, "calendar", conventions().localeCalendarIdentifier);
}

void SBLNetworkRequestFactory::_addEffectiveSystemLanguageQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  addIfPresent(builder, "esl", context_.effectiveSystemLanguage);
}

void SBLNetworkRequestFactory::_addDebugQueryItems(Builder& builder) const {
  beginStep(builder, __func__);
  builder.forceQueryItemsFromArray(context_.debuggingQueryItems);
}

void SBLNetworkRequestFactory::_addBrambleQueryItem(Builder& builder) const {
  beginStep(builder, __func__);
  builder.defaultQueryItemWithName("bramble", assembly_.useBramble() ? "1" : "0");
}

void SBLNetworkRequestFactory::_addHttpRequestUserGuid(Builder& builder, const UUID& userGuid) const {
  beginStep(builder, __func__);
  builder.defaultHttpHeaderWithName("X-Kestrel-UserGuid", userGuid.string());
}

void SBLNetworkRequestFactory::_addHttpRequestUserAgent(Builder& builder, std::string_view userAgent) const {
  beginStep(builder, __func__);
  addHeaderIfPresent(builder, "User-Agent", userAgent);
}

void SBLNetworkRequestFactory::_addHttpRequestUIScale(Builder& builder, double scale) const {
  beginStep(builder, __func__);
  if (scale > 0) builder.defaultHttpHeaderWithName(kUIScaleHeader, fmt::format("{:.1f}", scale));
}

void SBLNetworkRequestFactory::_addHttpRequestPreferredLanguages(Builder& builder) const {
  beginStep(builder, __func__);
  addHeaderIfPresent(builder, "X-Kestrel-Languages", context_.preferredLanguages);
}

void SBLNetworkRequestFactory::_addHttpRequestMapsSessionId(Builder& builder) {
  beginStep(builder, __func__);
  const auto entity = getMapsUserSessionEntityAndReset(false);
  if (entity) addHeaderIfPresent(builder, "X-Kestrel-GeoSession", entity->sessionId);
}

void SBLNetworkRequestFactory::_addHttpMapsEnvironmentName(Builder& builder, const SBLBag& bag) const {
  beginStep(builder, __func__);
  if (!bag.sendGeoEnvironmentHeader()) return;
  builder.defaultHttpHeaderWithName("X-Kestrel-GeoEnvironment",
                                    assembly_.platform.mapsService().environmentName());
}

void SBLNetworkRequestFactory::_addHttpRequestSubscriptionInfo(Builder& builder) const {
  beginStep(builder, __func__);
  if (context_.subscriptionInfo) {
    builder.defaultHttpHeaderWithName("X-Kestrel-Subscriptions", *context_.subscriptionInfo);
  }
}

void SBLNetworkRequestFactory::_addHttpAppWhitelistSignature(Builder& builder) const {
  beginStep(builder, __func__);
  if (assembly_.appWhitelistController == nullptr) return;
  const auto signature = assembly_.appWhitelistController->whitelistSignature();
  if (signature) addHeaderIfPresent(builder, "X-Kestrel-Whitelisted-App-Signature", *signature);
}

void SBLNetworkRequestFactory::_addHttpRequestTopTopics(Builder& builder,
                                                        const SBLSearchRequest& input) const {
  beginStep(builder, __func__);
  constexpr std::size_t kMaximumTopicsBytes = 64u << 10;
  if (!input.topics) return;
  // Written anew, so that a client's line breaks never reach a header.
  const auto topics = parseJSON(*input.topics, kMaximumTopicsBytes);
  if (!topics) {
    SableLogForCategory(SableLoggingCategoryRequest)
        .error("topics of {} bytes are left out: {}", input.topics->size(), topics.error().reason);
    return;
  }
  builder.defaultHttpHeaderWithName("X-Kestrel-TopTopics", compactJSON(*topics));
}

void SBLNetworkRequestFactory::_addHttpFuzzedLocation(Builder& builder) {
  beginStep(builder, __func__);
  if (!builder.isTraced()) context_.downloadPlace = context_.lookupPlace;
  addHeaderIfPresent(builder, "X-Kestrel-FuzzedLatLong", _getLookupLatLng());
}

void SBLNetworkRequestFactory::_addHttpIfNoneMatch(Builder& builder, std::string_view version) const {
  beginStep(builder, __func__);
  addHeaderIfPresent(builder, "If-None-Match", version);
}

void SBLNetworkRequestFactory::_addHttpGeoClientMetadata(Builder& builder) const {
  beginStep(builder, __func__);
  if (context_.geoClientMetadata) {
    builder.defaultHttpHeaderWithName("X-Kestrel-GeoMetadata", *context_.geoClientMetadata);
  }
}

std::string SBLNetworkRequestFactory::_languageForString(std::string_view text,
                                                         const std::optional<std::string>& keyboard) const {
  if (text.empty()) return {};
  std::vector<std::string> hints;
  if (keyboard) hints.push_back(keyboard->substr(0, keyboard->find_first_of("_-@")));
  for (std::string& language : assembly_.platform.localeInfo().preferredLanguages()) {
    hints.push_back(std::move(language));
  }
  const std::string tag = assembly_.platform.languageTagger().dominantLanguage(text, hints);
  return tag == "und" ? std::string() : tag;
}

}  // namespace sable
