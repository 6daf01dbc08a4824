#pragma once

#include <vector>

#include "platform/Process.h"

namespace sable::platform {

class AccountStore;
class ActivityScheduler;
class ApplicationRegistry;
class CountryConfiguration;
class DataDetectors;
class DeepLinkSpool;
class DeviceInfo;
class DifferentialPrivacy;
class FileManager;
class HTTPSessions;
class InputModes;
class LanguageTagger;
class LocaleInfo;
class LocationService;
class ManagedConfiguration;
class MapsService;
class MemoryPressure;
class NetworkServiceProxy;
class NotificationCenter;
class Notify;
class Relay;
class Runtime;
class SubscriptionRegistry;
class Tally;
class Transactions;
class UserActivity;
class UserDefaults;
class WordTokenizer;

/// The device under the daemon: one object per facility, made when first asked for (a facility
/// that is never used costs nothing) and kept for the life of the platform. Any thread.
class Platform {
 public:
  virtual ~Platform() = default;

  virtual Runtime& runtime() = 0;
  virtual Process& process() = 0;
  virtual Tally& tally() = 0;
  virtual UserDefaults& userDefaults() = 0;
  virtual FileManager& fileManager() = 0;
  virtual NotificationCenter& notificationCenter() = 0;
  virtual Notify& notify() = 0;
  virtual Relay& relay() = 0;
  virtual HTTPSessions& httpSessions() = 0;
  virtual Transactions& transactions() = 0;
  virtual MemoryPressure& memoryPressure() = 0;
  virtual ActivityScheduler& activityScheduler() = 0;

  virtual DeviceInfo& deviceInfo() = 0;
  virtual LocaleInfo& localeInfo() = 0;
  virtual InputModes& inputModes() = 0;
  virtual CountryConfiguration& countryConfiguration() = 0;
  virtual LocationService& locationService() = 0;
  virtual ManagedConfiguration& managedConfiguration() = 0;
  virtual AccountStore& accountStore() = 0;
  virtual MapsService& mapsService() = 0;
  virtual ApplicationRegistry& applicationRegistry() = 0;
  virtual LanguageTagger& languageTagger() = 0;
  virtual NetworkServiceProxy& networkServiceProxy() = 0;
  virtual UserActivity& userActivity() = 0;
  virtual SubscriptionRegistry& subscriptionRegistry() = 0;
  virtual WordTokenizer& wordTokenizer() = 0;
  virtual DataDetectors& dataDetectors() = 0;
  virtual DeepLinkSpool& deepLinkSpool() = 0;
  virtual DifferentialPrivacy& differentialPrivacy() = 0;

  /// What the host offers and lacks.
  virtual std::vector<Availability> availability() = 0;
};

}  // namespace sable::platform
