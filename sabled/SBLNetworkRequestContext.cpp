#include <fmt/core.h>

#include <any>
#include <nlohmann/json.hpp>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "platform/AccountStore.h"
#include "platform/CountryConfiguration.h"
#include "platform/LocaleInfo.h"
#include "platform/ManagedConfiguration.h"
#include "platform/NetworkServiceProxy.h"
#include "platform/Transaction.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"
#include "sabled/SplitText.h"
#include "sabled/UserAgent.h"

// The context half of the factory: what requests say about the device, kept current.
namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryRequest);
}

/// The measurement system's name on the wire; none for one that the service does not know.
std::string unitsName(std::string_view measurementSystem) {
  if (measurementSystem == "Metric") return "SI";
  if (measurementSystem == "U.S.") return "US";
  if (measurementSystem == "U.K.") return "UK";
  return {};
}

std::string firstThreeAsJSON(const std::vector<std::string>& languages) {
  Dictionary list = Dictionary::array();
  for (std::size_t i = 0; i < languages.size() && i < 3; ++i) list.push_back(languages[i]);
  return list.empty() ? std::string() : compactJSON(list);
}

constexpr std::size_t kMaximumSubscriptionBytes = 64u << 10;

/// Whether the service answers a client, where that client's application finds it without asking.
void keepVisibility(platform::UserDefaults& defaults, std::string_view key, const SBLBag& clientsBag) {
  if (defaults.boolean(key) != clientsBag.isEnabled()) defaults.set(key, clientsBag.isEnabled());
}

bool isRestricted(const platform::ManagedConfiguration& configuration) {
  return configuration.bookstoreAllowed() == platform::ManagedConfiguration::Effective::no ||
         !configuration.mediaStoreAllowed() || !configuration.appInstallationAllowed();
}

}  // namespace

SBLNetworkRequestFactory::SBLNetworkRequestFactory(Assembly& assembly)
    : assembly_(assembly),
      contextAccessQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.contextaccess")),
      locationQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.location")),
      sabledUserAgent_(sable::sabledUserAgent(assembly.platform.deviceInfo())) {
  _updateLocaleContexts(false);
  _updateDeviceCountryCode(false);
  _updateTimeZoneName();
  _updateDeviceRestrictions();
  _updateIsManagedAccount();
  _updateMapsClientMetadata();
  _setupDebuggingQueryItems();
  observeContextChanges();
}

SBLNetworkRequestFactory::~SBLNetworkRequestFactory() = default;

void SBLNetworkRequestFactory::observeContextChanges() {
  const auto on = [this](std::string_view name, auto handler) {
    observations_.push_back(assembly_.notificationCenter.observe(
        std::string(name), [handler](const platform::Notification&) { handler(); }));
  };
  on(platform::kCurrentLocaleDidChangeNotification, [this] { _updateLocaleContexts(true); });
  on(platform::kCountryCodeDidChangeNotification, [this] { _updateDeviceCountryCode(true); });
  on(platform::kSystemTimeZoneDidChangeNotification, [this] { _updateTimeZoneName(); });
  on(platform::kEffectiveSettingsDidChangeNotification, [this] { _updateDeviceRestrictions(); });
  on(platform::kAccountStoreDidChangeNotification, [this] { _updateIsManagedAccount(); });
  on(platform::kMapsServiceDidChangeNotification, [this] { _updateMapsClientMetadata(); });
  observations_.push_back(assembly_.notificationCenter.observe(
      std::string(kSBLBagChangeNotification), [this](const platform::Notification& notification) {
        if (const auto bag = bagFromNotification(notification)) _didGetBag(bag);
      }));
}

void SBLNetworkRequestFactory::_updateLocaleContexts(bool notifyBagRefreshRequired) {
  contextAccessQueue_->async([this, notifyBagRefreshRequired] {
    const auto& locale = assembly_.platform.localeInfo();
    context_.localeIdentifier = locale.localeIdentifier();
    context_.preferredLanguages = firstThreeAsJSON(locale.preferredLanguages());
    context_.effectiveSystemLanguage = locale.systemLanguage();
    context_.conventions.areCurrent = false;
    if (notifyBagRefreshRequired) _notifyBagRefreshRequired();
  });
}

const SBLNetworkRequestFactory::LocaleConventions& SBLNetworkRequestFactory::conventions() {
  contextAccessQueue_->assertIsCurrent();
  LocaleConventions& known = context_.conventions;
  if (known.areCurrent) return known;
  const auto& locale = assembly_.platform.localeInfo();
  known.localeCalendarIdentifier = locale.calendarIdentifier();
  known.localeMeasurementSystem = unitsName(locale.measurementSystem());
  if (const auto unit = locale.temperatureUnit()) known.tempUnits = unit->substr(0, 1);
  known.is24hDateFormat = locale.hourPattern().find("HH") != std::string::npos;
  known.areCurrent = true;
  return known;
}

std::string SBLNetworkRequestFactory::getDeviceCountryCode(const platform::CountryConfiguration& country) {
  return country.countryCode();
}

void SBLNetworkRequestFactory::_updateDeviceCountryCode(bool notifyBagRefreshRequired) {
  contextAccessQueue_->async([this, notifyBagRefreshRequired] {
    context_.geoDeviceCountryCode = getDeviceCountryCode(assembly_.platform.countryConfiguration());
    if (notifyBagRefreshRequired) _notifyBagRefreshRequired();
  });
}

void SBLNetworkRequestFactory::_updateTimeZoneName() {
  contextAccessQueue_->async(
      [this] { context_.localTimeZoneName = assembly_.platform.localeInfo().timeZoneName(); });
}

void SBLNetworkRequestFactory::_updateDeviceRestrictions() {
  contextAccessQueue_->async([this] {
    log().standard("device restriction have changed, currently restriction status is {:d}",
                   context_.deviceRestricted);
    const bool restricted = isRestricted(assembly_.platform.managedConfiguration());
    if (restricted == context_.deviceRestricted) return;
    context_.deviceRestricted = restricted;
    log().standard("updating device restriction status to: {:d}", restricted);
  });
}

void SBLNetworkRequestFactory::_updateIsManagedAccount() {
  contextAccessQueue_->async([this] {
    const bool managed = assembly_.platform.accountStore().primaryAccountIsManaged();
    if (managed == context_.isManagedAccount) return;
    context_.isManagedAccount = managed;
    log().standard("updating managed account status to: {:d}", managed);
  });
}

void SBLNetworkRequestFactory::_updateMapsClientMetadata() {
  contextAccessQueue_->async(
      [this] { context_.geoClientMetadata = assembly_.platform.mapsService().clientMetadata(); });
}

void SBLNetworkRequestFactory::didUpdateSubscriptionDictionaries(const SableSubscriptionManager&,
                                                                 const Dictionary& subscriptions) {
  std::optional<std::string> json;
  if (!subscriptions.empty()) json = compactJSON(subscriptions);
  if (json && json->size() > kMaximumSubscriptionBytes) {
    log().error("{} bytes of subscriptions are not told", json->size());
    json.reset();
  }
  contextAccessQueue_->async([this, json = std::move(json)] { context_.subscriptionInfo = json; });
}

void SBLNetworkRequestFactory::didUpdateStorefrontIdentifier(const SableSubscriptionManager&,
                                                             const std::string& identifier) {
  contextAccessQueue_->async([this, identifier] { context_.storeFrontIdentifier = identifier; });
}

void SBLNetworkRequestFactory::_setupDebuggingQueryItems() {
  contextAccessQueue_->async([this] {
    const std::string parameters = assembly_.userDefaults.string("SBLDebugParameters").value_or("");
    log().standard("processing debug parameters: ({})", parameters);
    if (parameters.empty()) return;
    context_.debuggingQueryItems.clear();
    for (const std::string& piece : split(parameters, '&')) {
      const auto parts = split(piece, '=');
      if (parts.size() != 2) {
        log().error("invalid query components: {}", piece);
        continue;
      }
      context_.debuggingQueryItems.push_back({parts[0], parts[1]});
    }
  });
}

void SBLNetworkRequestFactory::_notifyBagRefreshRequired() {
  // Posted off the context queue: the bag controller asks for a request at once.
  assembly_.runtime.globalQueue(platform::QualityOfService::standard).async([this] {
    assembly_.notificationCenter.post({kSBLBagRefreshRequired, this, {}});
  });
}

void SBLNetworkRequestFactory::_didGetBag(const std::shared_ptr<const SBLBag>& bag) {
  contextAccessQueue_->async([this, bag] {
    context_.supportedGeoLocationSources = bag->supportedGeoLocationSources();
    if (!std::exchange(context_.hadBag, true)) _setupLocationServices();
  });
  assembly_.runtime.globalQueue(platform::QualityOfService::background)
      .async([this, bag, transaction = assembly_.platform.transactions().open("updatePC")] {
        updateHashtagImagesVisibility(*bag);
        updateNewsVisibility(*bag);
      });
  const auto configured =
      assembly_.platform.networkServiceProxy().setConfiguration("sabled", bag->brambleConfiguration());
  if (!configured) log().error("PXS configuration failed.");
}

void SBLNetworkRequestFactory::updateHashtagImagesVisibility(const SBLBag& bag) {
  keepVisibility(assembly_.userDefaults, kSBLHashtagImagesVisible, SBLBag(bag.rawBag(), "messages/1.0"));
}

void SBLNetworkRequestFactory::updateNewsVisibility(const SBLBag& bag) {
  keepVisibility(assembly_.userDefaults, kSBLNewsVisible, SBLBag(bag.rawBag(), "news/1.0"));
}

std::optional<platform::MapsService::SessionEntity>
SBLNetworkRequestFactory::getMapsUserSessionEntityAndReset(bool reset) {
  return assembly_.platform.mapsService().userSessionEntity(reset);
}

}  // namespace sable
