#include "platform/host/HostPlatform.h"

#include <mutex>
#include <optional>

#include "platform/ConfiguredServiceProxy.h"
#include "platform/DeepLinkSpool.h"
#include "platform/ICUWordTokenizer.h"
#include "platform/NotificationCenter.h"
#include "platform/ScriptLanguageTagger.h"
#include "platform/SpooledDataDetectors.h"
#include "platform/host/FactFacilities.h"
#include "platform/host/Folders.h"
#include "platform/host/HostActivityScheduler.h"
#include "platform/host/HostApplicationRegistry.h"
#include "platform/host/HostDeviceInfo.h"
#include "platform/host/HostDifferentialPrivacy.h"
#include "platform/host/HostFacts.h"
#include "platform/host/HostFileManager.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/HostLocation.h"
#include "platform/host/HostMemoryPressure.h"
#include "platform/host/HostNotify.h"
#include "platform/host/HostProcess.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/HostSubscriptionRegistry.h"
#include "platform/host/HostTransactions.h"
#include "platform/host/HostUserActivity.h"
#include "platform/host/MappedTally.h"
#include "platform/host/PowerSupply.h"
#include "platform/host/TOMLUserDefaults.h"
#include "platform/host/TransferStore.h"

namespace sable::platform::host {
namespace {

/// An object that is made when first asked for, once, from whatever thread.
template <class T>
class Lazy {
 public:
  template <class... Args>
  T& get(Args&&... args) {
    std::call_once(once_, [&] { object_.emplace(std::forward<Args>(args)...); });
    return *object_;
  }

 private:
  std::once_flag once_;
  std::optional<T> object_;
};

std::string pressureFile(const HostFacts& facts) {
  return facts.string("memory_pressure_file").value_or("");
}

}  // namespace

/// In the order in which they need each other.
struct HostPlatform::Facilities {
  explicit Facilities(HostPlatformConfiguration configuration)
      : socketPath(std::move(configuration.socketPath)) {}

  TOMLUserDefaults& settings() { return userDefaults.get(folders, runtime, runtime.reactor(), fileManager); }
  HostLocationService& location() { return locationService.get(runtime, hostFacts(), notificationCenter); }
  HostFacts& hostFacts() { return facts.get(folders, sources, runtime.reactor(), notificationCenter); }

  HostHTTPSessions::Transfers transfers();

  const std::filesystem::path socketPath;
  const Folders folders = Folders::fromEnvironment();
  const HostSources sources;
  HostRuntime runtime;
  HostProcess process{runtime.reactor()};
  HostFileManager fileManager{folders};
  NotificationCenter notificationCenter;
  ConfiguredServiceProxy networkServiceProxy;
  ScriptLanguageTagger languageTagger;
  ICUWordTokenizer wordTokenizer;
  SpooledDataDetectors dataDetectors{fileManager, folders.hints()};
  Lazy<MappedTally> tally;
  Lazy<TOMLUserDefaults> userDefaults;
  Lazy<HostNotify> notify;
  Lazy<HostTransactions> transactions;
  Lazy<HostRelay> relay;
  Lazy<HostHTTPSessions> httpSessions;
  Lazy<HostFacts> facts;
  Lazy<HostMemoryPressure> memoryPressure;
  Lazy<HostDeviceInfo> deviceInfo;
  Lazy<HostLocaleInfo> localeInfo;
  Lazy<HostInputModes> inputModes;
  Lazy<HostCountryConfiguration> countryConfiguration;
  Lazy<HostLocationService> locationService;
  Lazy<HostManagedConfiguration> managedConfiguration;
  Lazy<HostAccountStore> accountStore;
  Lazy<HostMapsService> mapsService;
  Lazy<HostApplicationRegistry> applicationRegistry;
  Lazy<HostUserActivity> userActivity;
  Lazy<HostActivityScheduler> activityScheduler;
  Lazy<HostSubscriptionRegistry> subscriptionRegistry;
  Lazy<DeepLinkSpool> deepLinkSpool;
  Lazy<HostDifferentialPrivacy> differentialPrivacy;
};

HostHTTPSessions::Transfers HostPlatform::Facilities::transfers() {
  auto keepsUploads = [this] { return settings().boolean("SBLKeepUploads").value_or(true); };
  auto conditions = [this] {
    const HostFacts& known = hostFacts();
    return TransferConditions{known.boolean("on_battery").value_or(runsOnBattery(known.sources().root)),
                              known.boolean("metered").value_or(false)};
  };
  return {notificationCenter, std::make_shared<TransferStore>(folders.state, std::move(keepsUploads)),
          std::move(conditions)};
}

HostPlatform::HostPlatform(HostPlatformConfiguration configuration)
    : facilities_(std::make_unique<Facilities>(std::move(configuration))) {}

HostPlatform::~HostPlatform() = default;

bool HostPlatform::configurationIsReadable() {
  // Both are read, so that both are reported.
  const bool settings = facilities_->settings().isReadable(), facts = facilities_->hostFacts().areReadable();
  return settings && facts;
}

Runtime& HostPlatform::runtime() {
  return facilities_->runtime;
}
Process& HostPlatform::process() {
  return facilities_->process;
}
FileManager& HostPlatform::fileManager() {
  return facilities_->fileManager;
}
NotificationCenter& HostPlatform::notificationCenter() {
  return facilities_->notificationCenter;
}
LanguageTagger& HostPlatform::languageTagger() {
  return facilities_->languageTagger;
}
NetworkServiceProxy& HostPlatform::networkServiceProxy() {
  return facilities_->networkServiceProxy;
}

Tally& HostPlatform::tally() {
  return facilities_->tally.get(facilities_->folders.counters());
}

UserDefaults& HostPlatform::userDefaults() {
  return facilities_->settings();
}

Notify& HostPlatform::notify() {
  return facilities_->notify.get(facilities_->runtime);
}

Transactions& HostPlatform::transactions() {
  return facilities_->transactions.get(facilities_->runtime);
}

Relay& HostPlatform::relay() {
  HostRelayConfiguration configuration;
  configuration.runtimeFolder = facilities_->folders.runtime;
  configuration.socketPath = facilities_->socketPath;
  return facilities_->relay.get(facilities_->runtime, std::move(configuration));
}

HTTPSessions& HostPlatform::httpSessions() {
  auto& facilities = *facilities_;
  return facilities.httpSessions.get(facilities.runtime, facilities.folders.caches, facilities.transfers());
}

MemoryPressure& HostPlatform::memoryPressure() {
  MemoryPressurePaths paths;
  paths.file = pressureFile(facilities_->hostFacts());
  return facilities_->memoryPressure.get(facilities_->runtime.reactor(), std::move(paths));
}

ActivityScheduler& HostPlatform::activityScheduler() {
  auto& facilities = *facilities_;
  return facilities.activityScheduler.get(facilities.runtime, facilities.notificationCenter,
                                          facilities.hostFacts(), facilities.fileManager,
                                          facilities.folders.activityRuns());
}

DeviceInfo& HostPlatform::deviceInfo() {
  return facilities_->deviceInfo.get(facilities_->hostFacts());
}
LocaleInfo& HostPlatform::localeInfo() {
  return facilities_->localeInfo.get(facilities_->hostFacts());
}
InputModes& HostPlatform::inputModes() {
  return facilities_->inputModes.get(facilities_->hostFacts());
}

CountryConfiguration& HostPlatform::countryConfiguration() {
  return facilities_->countryConfiguration.get(facilities_->hostFacts());
}

LocationService& HostPlatform::locationService() {
  return facilities_->location();
}

ManagedConfiguration& HostPlatform::managedConfiguration() {
  return facilities_->managedConfiguration.get(facilities_->hostFacts());
}

AccountStore& HostPlatform::accountStore() {
  return facilities_->accountStore.get(facilities_->hostFacts());
}
MapsService& HostPlatform::mapsService() {
  return facilities_->mapsService.get(facilities_->runtime, facilities_->hostFacts());
}

ApplicationRegistry& HostPlatform::applicationRegistry() {
  auto& facilities = *facilities_;
  return facilities.applicationRegistry.get(facilities.folders, facilities.hostFacts(),
                                            facilities.runtime.reactor(), facilities.notificationCenter);
}

UserActivity& HostPlatform::userActivity() {
  auto& facilities = *facilities_;
  return facilities.userActivity.get(facilities.runtime, facilities.settings(), facilities.fileManager,
                                     facilities.folders.interactions());
}

SubscriptionRegistry& HostPlatform::subscriptionRegistry() {
  auto& facilities = *facilities_;
  return facilities.subscriptionRegistry.get(facilities.folders, facilities.hostFacts(), facilities.runtime,
                                             facilities.runtime.reactor(), facilities.notificationCenter);
}

WordTokenizer& HostPlatform::wordTokenizer() {
  return facilities_->wordTokenizer;
}

DataDetectors& HostPlatform::dataDetectors() {
  return facilities_->dataDetectors;
}

DeepLinkSpool& HostPlatform::deepLinkSpool() {
  auto& facilities = *facilities_;
  return facilities.deepLinkSpool.get(facilities.fileManager, facilities.runtime,
                                      facilities.folders.deepLinks());
}

DifferentialPrivacy& HostPlatform::differentialPrivacy() {
  auto& facilities = *facilities_;
  return facilities.differentialPrivacy.get(facilities.runtime, facilities.settings(), facilities.fileManager,
                                            facilities.folders.privateReports());
}

std::vector<Availability> HostPlatform::availability() {
  notify();
  memoryPressure();
  auto& tallyFile = facilities_->tally.get(facilities_->folders.counters());
  return {
      {"counters", tallyFile.isPersistent(), facilities_->folders.counters().string()},
      {"maps service", mapsService().userSessionEntity(false).has_value(), "geo_session_id of the facts"},
      facilities_->location().availability(),
      facilities_->notify.get(facilities_->runtime).availability(),
      facilities_->memoryPressure.get(facilities_->runtime.reactor()).availability(),
  };
}

}  // namespace sable::platform::host
