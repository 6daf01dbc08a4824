#pragma once

#include "platform/ConfiguredServiceProxy.h"
#include "platform/DeepLinkSpool.h"
#include "platform/ICUWordTokenizer.h"
#include "platform/NotificationCenter.h"
#include "platform/Platform.h"
#include "platform/ScriptLanguageTagger.h"
#include "platform/SpooledDataDetectors.h"
#include "platform/simulated/SimulatedActivityScheduler.h"
#include "platform/simulated/SimulatedDifferentialPrivacy.h"
#include "platform/simulated/SimulatedFacts.h"
#include "platform/simulated/SimulatedFileManager.h"
#include "platform/simulated/SimulatedHTTP.h"
#include "platform/simulated/SimulatedLocation.h"
#include "platform/simulated/SimulatedMemoryPressure.h"
#include "platform/simulated/SimulatedNotify.h"
#include "platform/simulated/SimulatedProcess.h"
#include "platform/simulated/SimulatedRelay.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "platform/simulated/SimulatedSubscriptionRegistry.h"
#include "platform/simulated/SimulatedTally.h"
#include "platform/simulated/SimulatedTransactions.h"
#include "platform/simulated/SimulatedUserActivity.h"
#include "platform/simulated/SimulatedUserDefaults.h"

namespace sable::platform::simulated {

/// A device in memory and virtual time. A test reaches each facility's double through its member;
/// the daemon sees the interfaces only.
class SimulatedPlatform final : public Platform {
 public:
  explicit SimulatedPlatform(std::uint64_t seed = 1) : runtime_(seed) {}

  SimulatedRuntime& runtime() override { return runtime_; }
  SimulatedProcess& process() override { return process_; }
  SimulatedTally& tally() override { return tally_; }
  SimulatedUserDefaults& userDefaults() override { return userDefaults_; }
  SimulatedFileManager& fileManager() override { return fileManager_; }
  NotificationCenter& notificationCenter() override { return notificationCenter_; }
  SimulatedNotify& notify() override { return notify_; }
  SimulatedRelay& relay() override { return relay_; }
  SimulatedHTTPSessions& httpSessions() override { return httpSessions_; }
  SimulatedTransactions& transactions() override { return transactions_; }
  SimulatedMemoryPressure& memoryPressure() override { return memoryPressure_; }
  SimulatedActivityScheduler& activityScheduler() override { return activityScheduler_; }

  SimulatedDeviceInfo& deviceInfo() override { return deviceInfo_; }
  SimulatedLocaleInfo& localeInfo() override { return localeInfo_; }
  SimulatedInputModes& inputModes() override { return inputModes_; }
  SimulatedCountryConfiguration& countryConfiguration() override { return countryConfiguration_; }
  SimulatedLocationService& locationService() override { return locationService_; }
  SimulatedManagedConfiguration& managedConfiguration() override { return managedConfiguration_; }
  SimulatedAccountStore& accountStore() override { return accountStore_; }
  SimulatedMapsService& mapsService() override { return mapsService_; }
  SimulatedApplicationRegistry& applicationRegistry() override { return applicationRegistry_; }
  ScriptLanguageTagger& languageTagger() override { return languageTagger_; }
  ConfiguredServiceProxy& networkServiceProxy() override { return networkServiceProxy_; }
  SimulatedUserActivity& userActivity() override { return userActivity_; }
  ICUWordTokenizer& wordTokenizer() override { return wordTokenizer_; }
  /// Its folder is "/state/hints" of the file manager.
  SpooledDataDetectors& dataDetectors() override { return dataDetectors_; }
  SimulatedSubscriptionRegistry& subscriptionRegistry() override { return subscriptionRegistry_; }
  DeepLinkSpool& deepLinkSpool() override { return deepLinkSpool_; }
  SimulatedDifferentialPrivacy& differentialPrivacy() override { return differentialPrivacy_; }

  /// Where applications drop deep links.
  static std::filesystem::path deepLinks() { return "/home/user/.local/state/deeplinks"; }

  std::vector<Availability> availability() override { return {}; }

 private:
  NotificationCenter notificationCenter_;
  SimulatedTally tally_;
  SimulatedUserDefaults userDefaults_;
  SimulatedFileManager fileManager_{runtime_};
  SimulatedNotify notify_;
  SimulatedTransactions transactions_;
  SimulatedMemoryPressure memoryPressure_;
  SimulatedDeviceInfo deviceInfo_;
  SimulatedLocaleInfo localeInfo_{notificationCenter_};
  SimulatedInputModes inputModes_;
  SimulatedCountryConfiguration countryConfiguration_{notificationCenter_};
  SimulatedLocationService locationService_;
  SimulatedManagedConfiguration managedConfiguration_{notificationCenter_};
  SimulatedAccountStore accountStore_{notificationCenter_};
  SimulatedMapsService mapsService_{notificationCenter_};
  SimulatedApplicationRegistry applicationRegistry_{notificationCenter_};
  ScriptLanguageTagger languageTagger_;
  ICUWordTokenizer wordTokenizer_;
  SpooledDataDetectors dataDetectors_{fileManager_, "/state/hints"};
  ConfiguredServiceProxy networkServiceProxy_;
  SimulatedUserActivity userActivity_;
  DeepLinkSpool deepLinkSpool_{fileManager_, runtime_, deepLinks()};
  SimulatedDifferentialPrivacy differentialPrivacy_;

  // Last: what is still queued goes first.
  SimulatedRuntime runtime_;
  SimulatedProcess process_{runtime_};
  SimulatedRelay relay_{runtime_};
  SimulatedHTTPSessions httpSessions_{runtime_, notificationCenter_, fileManager_};
  SimulatedActivityScheduler activityScheduler_{runtime_, notificationCenter_};
  SimulatedSubscriptionRegistry subscriptionRegistry_{runtime_, notificationCenter_};
};

}  // namespace sable::platform::simulated
