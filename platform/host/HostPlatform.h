#pragma once

#include <filesystem>
#include <memory>

#include "platform/Platform.h"

namespace sable::platform::host {

struct HostPlatformConfiguration {
  /// The named listener's socket; empty: relay.sock in the runtime folder.
  std::filesystem::path socketPath = {};
};

/// This machine. Folders come from the environment (Folders). Construct it on the main thread,
/// before any other thread runs; what has not been asked for is not there.
class HostPlatform final : public Platform {
 public:
  explicit HostPlatform(HostPlatformConfiguration configuration = {});
  ~HostPlatform() override;

  /// Whether settings and facts can be read; the log tells which file cannot, and where.
  bool configurationIsReadable();

  Runtime& runtime() override;
  Process& process() override;
  Tally& tally() override;
  UserDefaults& userDefaults() override;
  FileManager& fileManager() override;
  NotificationCenter& notificationCenter() override;
  Notify& notify() override;
  Relay& relay() override;
  HTTPSessions& httpSessions() override;
  Transactions& transactions() override;
  MemoryPressure& memoryPressure() override;
  ActivityScheduler& activityScheduler() override;

  DeviceInfo& deviceInfo() override;
  LocaleInfo& localeInfo() override;
  InputModes& inputModes() override;
  CountryConfiguration& countryConfiguration() override;
  LocationService& locationService() override;
  ManagedConfiguration& managedConfiguration() override;
  AccountStore& accountStore() override;
  MapsService& mapsService() override;
  ApplicationRegistry& applicationRegistry() override;
  LanguageTagger& languageTagger() override;
  NetworkServiceProxy& networkServiceProxy() override;
  UserActivity& userActivity() override;
  SubscriptionRegistry& subscriptionRegistry() override;
  WordTokenizer& wordTokenizer() override;
  DataDetectors& dataDetectors() override;
  DeepLinkSpool& deepLinkSpool() override;
  DifferentialPrivacy& differentialPrivacy() override;

  std::vector<Availability> availability() override;

 private:
  struct Facilities;
  const std::unique_ptr<Facilities> facilities_;
};

}  // namespace sable::platform::host
