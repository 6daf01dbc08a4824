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
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"
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

std::vector<std::string> split(std::string_view text, char separator) {
  std::vector<std::string> pieces;
  for (std::size_t start = 0;;) {
    const std::size_t end = text.find(separator, start);
    pieces.emplace_back(text.substr(start, end - start));
    if (end == std::string_view::npos) return pieces;
    start = end + 1;
  }
}

bool isRestricted(const platform::ManagedConfiguration& configuration) {
  return configuration.bookstoreAllowed() == platform::ManagedConfiguration::Effective::no ||
         !configuration.mediaStoreAllowed() || !configuration.appInstallationAllowed();
}

}  // namespace

SBLNetworkRequestFactory::SBLNetworkRequestFactory(Assembly& assembly)
    : assembly_(assembly),
      contextAccessQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.contextaccess")),
      sabledUserAgent_(sable::sabledUserAgent(assembly.platform.deviceInfo())) {
  _updateLocaleContexts(false);
  _updateDeviceCountryCode(false);
  _updateTimeZoneName();
  _updateDeviceRestrictions();
  _updateAccount();
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
  on(platform::kAccountStoreDidChangeNotification, [this] { _updateAccount(); });
  observations_.push_back(assembly_.notificationCenter.observe(
      std::string(kSBLBagChangeNotification), [this](const platform::Notification& notification) {
        if (const auto bag = bagFromNotification(notification)) _didGetBag(*bag);
      }));
}

void SBLNetworkRequestFactory::_updateLocaleContexts(bool notifyBagRefreshRequired) {
  contextAccessQueue_->async([this, notifyBagRefreshRequired] {
    const auto& locale = assembly_.platform.localeInfo();
    context_.localeIdentifier = locale.localeIdentifier();
    context_.preferredLanguages = firstThreeAsJSON(locale.preferredLanguages());
    context_.effectiveSystemLanguage = locale.systemLanguage();
    context_.conventions.reset();
    if (notifyBagRefreshRequired) _notifyBagRefreshRequired();
  });
}

const SBLNetworkRequestFactory::LocaleConventions& SBLNetworkRequestFactory::conventions() {
  contextAccessQueue_->assertIsCurrent();
  if (!context_.conventions) {
    const auto& locale = assembly_.platform.localeInfo();
    LocaleConventions& made = context_.conventions.emplace(LocaleConventions{});
    made.localeCalendarIdentifier = locale.calendarIdentifier();
    made.localeMeasurementSystem = unitsName(locale.measurementSystem());
    made.tempUnits = locale.temperatureUnit().value_or("").substr(0, 1);
    made.is24hDateFormat = locale.hourPattern().find("HH") != std::string::npos;
  }
  return *context_.conventions;
}

void SBLNetworkRequestFactory::_updateDeviceCountryCode(bool notifyBagRefreshRequired) {
  contextAccessQueue_->async([this, notifyBagRefreshRequired] {
    context_.geoDeviceCountryCode = assembly_.platform.countryConfiguration().countryCode();
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

void SBLNetworkRequestFactory::_updateAccount() {
  contextAccessQueue_->async([this] {
    const auto& accounts = assembly_.platform.accountStore();
    context_.storeFrontIdentifier = accounts.storeFrontIdentifier().value_or("");
    const bool managed = accounts.primaryAccountIsManaged();
    if (managed == context_.isManagedAccount) return;
    context_.isManagedAccount = managed;
    log().standard("updating managed account status to: {:d}", managed);
  });
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

void SBLNetworkRequestFactory::_didGetBag(const SBLBag& bag) {
  const auto configured =
      assembly_.platform.networkServiceProxy().setConfiguration("sabled", bag.brambleConfiguration());
  if (!configured) log().error("PXS configuration failed.");
}

std::optional<platform::MapsService::SessionEntity>
SBLNetworkRequestFactory::getMapsUserSessionEntityAndReset(bool reset) {
  return assembly_.platform.mapsService().userSessionEntity(reset);
}

}  // namespace sable
