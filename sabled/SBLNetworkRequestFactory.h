#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "SableKit/SBLRequest.h"
#include "platform/HTTPSession.h"
#include "platform/LocationService.h"
#include "platform/MapsService.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"
#include "platform/URL.h"
#include "platform/UUID.h"
#include "sabled/CoarseLocation.h"
#include "sabled/SableSubscriptionManager.h"

namespace sable {

namespace platform {
class CountryConfiguration;
}

class Assembly;
class RequestTrace;
class SBLBag;
class SableBagController;
class SableURLRequestBuilder;

/// Posted (object: the factory) when the locale, region or country changed, on which the bag's URL
/// depends.
inline constexpr std::string_view kSBLBagRefreshRequired = "SBLBagRefreshRequired";

/// Posted (object: the factory) when a search was sent from a place some 50 km and more from the one that
/// the last download for lookups told.
inline constexpr std::string_view kSBLSignificantLocationChangeNotification =
    "SBLSignificantLocationChangeNotification";

/// The scale of the client's screen, with one decimal.
inline constexpr std::string_view kUIScaleHeader = "X-Kestrel-UI-Scale";

/// Bit 0 of a field mask: nothing that tells where the device is, and no privacy proxy.
inline constexpr unsigned kSBLFieldMaskNoLocation = 1;

/// Builds every request that the daemon sends, from what the client asked, the bag and the context
/// of the device (locale, location, country, time zone, restrictions), which it keeps current. Any
/// thread: each entry point builds synchronously on the context queue, so that one request sees one
/// context. docs/service.md lists every item and header.
class SBLNetworkRequestFactory final : public SableSubscriptionManagerDelegate {
 public:
  explicit SBLNetworkRequestFactory(Assembly& assembly);
  ~SBLNetworkRequestFactory() override;

  // A `trace` is told how a request came about. Who brings one only wants to know: the device is not
  // located for it.
  platform::HTTPRequest warmRequest(std::string_view url);
  platform::HTTPRequest bagFetchRequest(const SableBagController& bagController, std::string_view userAgent,
                                        std::string_view version, RequestTrace* trace = nullptr);
  /// Never sent: its URL changes exactly when the locale, languages, country, agent or debug items
  /// do, which is how an outdated bag is recognised.
  platform::HTTPRequest bagCacheRequest(const SableBagController& bagController, std::string_view userAgent,
                                        std::string_view version);

  // nullopt when the bag has no search URL.
  std::optional<platform::HTTPRequest> searchRequest(const SBLSearchRequest& input, const SBLBag& bag,
                                                     const UUID& userGuid, unsigned fieldMask = 0,
                                                     RequestTrace* trace = nullptr);
  std::optional<platform::HTTPRequest> zeroKeywordRequest(const SBLZeroKeywordRequest& input,
                                                          const SBLBag& bag, const UUID& userGuid,
                                                          unsigned fieldMask = 0,
                                                          RequestTrace* trace = nullptr);
  std::optional<platform::HTTPRequest> lookupRequest(const SBLLookupRequest& input, const SBLBag& bag,
                                                     const UUID& userGuid, RequestTrace* trace = nullptr);

  platform::HTTPRequest moreResultsRequest(const SBLMoreResultsRequest& input, const SBLBag& bag,
                                           const UUID& userGuid, unsigned fieldMask = 0,
                                           RequestTrace* trace = nullptr);
  platform::HTTPRequest cardRequest(const SBLCardRequest& input, const SBLBag& bag, const UUID& userGuid,
                                    RequestTrace* trace = nullptr);

  platform::HTTPRequest fileDownloadRequest(std::string_view url, std::string_view version,
                                            bool includeLatLong, RequestTrace* trace = nullptr);
  /// `timeout` in seconds; `digest` identifies the body that the caller will add.
  platform::HTTPRequest flusherUploadRequest(std::string_view url, double timeout, std::string_view digest,
                                             RequestTrace* trace = nullptr);

  /// A product token such as "Beacon/1" as a full user agent; "" for an empty token.
  std::string createUserAgentString(std::string_view product) const;

  /// The map session that searches and later map requests share; `reset` begins a new one first.
  std::optional<platform::MapsService::SessionEntity> getMapsUserSessionEntityAndReset(bool reset);

  /// A search was sent: downloads for lookups may from now on tell where the device is now.
  void setPerformedSearch();

  /// An empty list is not told to the service, nor is one of more than 64 KiB.
  void didUpdateSubscriptionDictionaries(const SableSubscriptionManager& manager,
                                         const Dictionary& subscriptions) override;
  void didUpdateStorefrontIdentifier(const SableSubscriptionManager& manager,
                                     const std::string& identifier) override;

 private:
  using Builder = SableURLRequestBuilder;

  /// What the locale's conventions make of numbers and dates. Working them out loads locale data,
  /// so that waits for the first request that carries them.
  struct LocaleConventions {
    bool areCurrent = false;
    std::string localeCalendarIdentifier;
    std::string localeMeasurementSystem;
    std::string tempUnits;
    bool is24hDateFormat = false;
  };

  /// Everything a request says about the device; empty: not known.
  struct Context {
    struct Location {
      CoarseLocation place;
      platform::WallTime timestamp;
    };

    std::string localeIdentifier;
    std::string effectiveSystemLanguage;
    std::string preferredLanguages;  ///< JSON array of up to three
    LocaleConventions conventions;
    std::string geoDeviceCountryCode;
    std::string localTimeZoneName;
    std::set<std::string> supportedGeoLocationSources;  ///< that the bag allows
    std::shared_ptr<platform::LocationManager> locationManager;
    std::optional<Location> geoLocation;          ///< the last fix that was accepted
    std::string geoLocationLatLng;                ///< "latitude,longitude" of it
    std::optional<CoarseLocation> lookupPlace;    ///< where the last search was sent
    std::string lookupGeoLocationLatLng;          ///< likewise, as text
    std::optional<CoarseLocation> downloadPlace;  ///< that the last download for lookups told
    std::string geoLocationSource;                ///< its source, or why there is none
    std::optional<std::string> geoClientMetadata;
    std::string storeFrontIdentifier;
    std::optional<std::string> subscriptionInfo;
    bool isManagedAccount = false;
    bool deviceRestricted = false;
    bool hadBag = false;
    std::vector<platform::URLQueryItem> debuggingQueryItems;
  };

  template <class Steps>
  platform::HTTPRequest build(std::string_view url, Steps steps, RequestTrace* trace = nullptr);
  platform::HTTPRequest proxiedIfEnabled(platform::HTTPRequest request) const;

  // Steps of a request, on the context queue; each adds one item or header as its name says.
  void beginStep(Builder& builder, const char* name) const;
  void _addSecretKeyQueryItem(Builder& builder) const;
  void _addLocaleQueryItem(Builder& builder) const;
  void _addDiagnosticsAndUsageQueryItem(Builder& builder) const;
  void _addKeyboardInputModeQueryItem(Builder& builder, const SBLRequest& input) const;
  void _addTempUnitPreferenceQueryItem(Builder& builder);
  void _addQueryLanguageQueryItem(Builder& builder, const SBLLookupRequest& input) const;
  void _addLookupContextLanguageQueryItem(Builder& builder, const SBLLookupRequest& input) const;
  void _addLookupHintDomainQueryItem(Builder& builder, const SBLLookupRequest& input) const;
  void _addClientContextQueryItem(Builder& builder, const SBLLookupRequest& input) const;
  void _addLookupSelectionType(Builder& builder, const SBLLookupRequest& input) const;
  void _addManagedAccountQueryItem(Builder& builder) const;
  void _addVersionQueryItem(Builder& builder, std::string_view version) const;
  void _addCardQueryItem(Builder& builder) const;
  void _addLocationQueryItem(Builder& builder) const;
  void _addLocationSourceQueryItem(Builder& builder) const;
  void _addAgentQueryItem(Builder& builder, std::string_view userAgent) const;
  void _addStoreFrontQueryItem(Builder& builder) const;
  void _addDeviceCountryCodeQueryItem(Builder& builder) const;
  void _addTemperatureUnitsQueryItem(Builder& builder);
  void _add24hDateFormatQueryItem(Builder& builder);
  void _addTimeZoneQueryItem(Builder& builder) const;
  void _addCalendarQueryItem(Builder& builder);
  void _addEffectiveSystemLanguageQueryItem(Builder& builder) const;
  void _addDebugQueryItems(Builder& builder) const;
  void _addBrambleQueryItem(Builder& builder) const;

  void _addHttpRequestUserGuid(Builder& builder, const UUID& userGuid) const;
  void _addHttpRequestUserAgent(Builder& builder, std::string_view userAgent) const;
  void _addHttpRequestUIScale(Builder& builder, double scale) const;
  void _addHttpRequestPreferredLanguages(Builder& builder) const;
  void _addHttpRequestMapsSessionId(Builder& builder);
  void _addHttpMapsEnvironmentName(Builder& builder, const SBLBag& bag) const;
  void _addHttpRequestSubscriptionInfo(Builder& builder) const;
  void _addHttpAppWhitelistSignature(Builder& builder) const;
  void _addHttpRequestTopTopics(Builder& builder, const SBLSearchRequest& input) const;
  void _addHttpFuzzedLocation(Builder& builder);
  void _addHttpIfNoneMatch(Builder& builder, std::string_view version) const;
  void _addHttpGeoClientMetadata(Builder& builder) const;

  std::string _languageForString(std::string_view text, const std::optional<std::string>& keyboard) const;

  // The context half.
  void observeContextChanges();
  void _updateLocaleContexts(bool notifyBagRefreshRequired);
  static std::string getDeviceCountryCode(const platform::CountryConfiguration& country);
  void _updateDeviceCountryCode(bool notifyBagRefreshRequired);
  void _updateTimeZoneName();
  void _updateDeviceRestrictions();
  void _updateIsManagedAccount();
  void _updateMapsClientMetadata();
  void _setupDebuggingQueryItems();
  void _notifyBagRefreshRequired();
  void _didGetBag(const std::shared_ptr<const SBLBag>& bag);
  void updateHashtagImagesVisibility(const SBLBag& bag);
  void updateNewsVisibility(const SBLBag& bag);
  const LocaleConventions& conventions();

  // Location, on the context queue. The manager is called, and tells what it has, on locationQueue_.
  void _setupLocationServices();
  void didChangeAuthorization(platform::LocationAuthorization status);
  void didUpdateLocation(const platform::LocationFix& fix);
  void startUpdatingLocationFor(const Builder& builder);
  void _startUpdatingLocation();
  void stopUpdatingLocation();
  static std::string_view _locationSourceForLocation(const platform::LocationFix& fix);
  bool _setLocationIfAllowedByBag(const platform::LocationFix& fix);
  bool _setLocation(const platform::LocationFix& fix, const std::string& source);
  void _setNoLocationWithReason(std::string_view reason);
  void noteLookupPlace(const CoarseLocation& place);
  const std::string& _getLookupLatLng() const;

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> contextAccessQueue_;
  const std::shared_ptr<platform::SerialQueue> locationQueue_;
  const std::string sabledUserAgent_;

  Context context_;  ///< on contextAccessQueue_
  std::vector<platform::NotificationCenter::Token> observations_;
};

}  // namespace sable
