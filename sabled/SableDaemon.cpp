#include "sabled/SableDaemon.h"

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLTracing.h"
#include "platform/NotificationCenter.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/AppWhitelistController.h"
#include "sabled/BackgroundActivitiesManager.h"
#include "sabled/ClientStateManager.h"
#include "sabled/DownloadManager.h"
#include "sabled/ImageFetcher.h"
#include "sabled/Lookup.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableDPAppDeepLinkIngester.h"
#include "sabled/SableFeedbackFlusher.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SableLogging.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableService.h"
#include "sabled/SableSubscriptionManager.h"
#include "sabled/SableUserGUIDController.h"

namespace sable {

using platform::QualityOfService;
using platform::TerminationSignal;

SableDaemon::SableDaemon(platform::Platform& device) : platform_(device), assembly_(device) {}

SableDaemon::~SableDaemon() = default;

Expected<void> SableDaemon::start() {
  SBLTracingSetup(assembly_.userDefaults);
  registerDefaults();
  createServices();
  if (auto opened = openListener(); !opened) {
    assembly_.clientStateManager.reset();  // and with them the endpoints that nobody will be told of
    assembly_.flusherRelayListener.reset();
    return opened;
  }
  installLaunchEventHandlers();
  loadBagEarly();
  postStartup();
  installSignalHandlers();
  logAvailability();
  return {};
}

void SableDaemon::registerDefaults() {
  Dictionary defaults;
  defaults[std::string(kSBLSharedSession)] = true;
  defaults[std::string(kSBLSessionSizeLimit)] = 2097152u;  // bytes
  defaults[std::string(kSBLSessionMaxAge)] = 172800u;      // seconds
  defaults[std::string(kSBLUseBramble)] = true;
  assembly_.userDefaults.registerDefaults(defaults);
}

void SableDaemon::createServices() {
  // The order is part of the design: a service may use in its constructor what stands before it.
  assembly_.requestFactory = std::make_unique<SBLNetworkRequestFactory>(assembly_);
  assembly_.subscriptionManager =
      std::make_unique<SableSubscriptionManager>(assembly_, *assembly_.requestFactory);
  assembly_.downloadManager = std::make_unique<DownloadManager>(assembly_);
  assembly_.persistentStorage = std::make_unique<SablePersistentStorage>(assembly_);
  assembly_.crowdsourcingFeedbackFlusher = std::make_unique<SableFeedbackFlusher>(assembly_, 0);
  assembly_.backgroundFlusher = std::make_unique<BackgroundActivitiesManager>(assembly_);
  assembly_.tally.add("com.kestrel.sabled.launch", 1);
  assembly_.imageFetcher = std::make_unique<ImageFetcher>(assembly_);
  assembly_.lookup = std::make_unique<Lookup>(assembly_);
  assembly_.bagController = std::make_unique<SableBagController>(assembly_);
  assembly_.clientStateManager = std::make_unique<ClientStateManager>(assembly_);
  assembly_.appWhitelistController = std::make_unique<AppWhitelistController>(assembly_);
  deepLinkIngester_ = std::make_unique<SableDPAppDeepLinkIngester>(assembly_);
  deepLinkIngester_->scheduleMaintenance();
  service_ = std::make_unique<SableService>(assembly_);
  // Not before: states take part in the shared session, which the service has made.
  assembly_.clientStateManager->loadState();
}

Expected<void> SableDaemon::openListener() {
  listener_ = platform_.relay().namedListener(kSBLServiceName);
  listener_->setAcceptHandler([this](const std::shared_ptr<platform::RelayConnection>& connection) {
    return service_->acceptConnection(connection);
  });
  return listener_->resume();
}

void SableDaemon::installLaunchEventHandlers() {
  const auto queue = assembly_.runtime.serialQueue("com.kestrel.sabled.relay_event");
  const auto logLaunch = [](const std::optional<std::string>& name) {
    SableDefaultLog().info("launch event for {}", name.value_or("(null)"));
  };
  platform_.relay().setEventStreamHandler("com.kestrel.httpsession.launch", queue, logLaunch);
  platform_.relay().setEventStreamHandler("com.kestrel.notifyd.matching", queue, logLaunch);
}

void SableDaemon::loadBagEarly() {
  assembly_.runtime.globalQueue(QualityOfService::background).async([this] {
    assembly_.bagController->currentBag();
  });
}

void SableDaemon::postStartup() {
  assembly_.runtime.globalQueue(QualityOfService::standard).async([this] {
    assembly_.notificationCenter.post({"SBLStartup", nullptr, {}});
  });
}

void SableDaemon::logAvailability() {
  assembly_.runtime.globalQueue(QualityOfService::background).async([this] {
    for (const platform::Availability& facility : platform_.availability()) {
      SableDefaultLog().info("{} {}: {}", facility.facility,
                             facility.available ? "available" : "not available", facility.detail);
    }
  });
}

void SableDaemon::installSignalHandlers() {
  auto& process = platform_.process();
  auto& queue = assembly_.runtime.globalQueue(QualityOfService::standard);
  const auto endWith = [&process](const char* name) {
    return [&process, name] {
      SableDefaultLog().debug("{}", name);
      process.exit(0);
    };
  };
  interrupt_ = process.signalSource(TerminationSignal::interrupt, queue, endWith("SIGINT"));
  terminate_ = process.signalSource(TerminationSignal::terminate, queue, endWith("SIGTERM"));
  process.ignoreSignal(TerminationSignal::interrupt);
  process.ignoreSignal(TerminationSignal::terminate);
  interrupt_->resume();
  terminate_->resume();
}

}  // namespace sable
