#include "sabled/Assembly.h"

#include "SableKit/SBLConstants.h"
#include "platform/FileManager.h"
#include "platform/HTTPBackgroundSession.h"
#include "platform/NotificationCenter.h"
#include "platform/ProgrammingError.h"
#include "platform/Subsystem.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/AppWhitelistController.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientStateManager.h"
#include "sabled/DownloadManager.h"
#include "sabled/ImageFetcher.h"
#include "sabled/Lookup.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableFeedbackFlusher.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableSubscriptionManager.h"
#include "sabled/SableUserGUIDController.h"

namespace sable {
namespace {

/// How long an idle connection to the service may stay open: a radio that could sleep costs more
/// than a new handshake.
constexpr platform::Duration kIdleConnectionTimeout = std::chrono::seconds(10);

}  // namespace

Assembly::Assembly(platform::Platform& device)
    : platform(device),
      runtime(device.runtime()),
      userDefaults(device.userDefaults()),
      fileManager(device.fileManager()),
      notificationCenter(device.notificationCenter()),
      tally(device.tally()) {}

Assembly::~Assembly() = default;

bool Assembly::useBramble() const {
  return userDefaults.boolean(kSBLUseBramble).value_or(false);
}

platform::HTTPSession& Assembly::urlSession() {
  std::call_once(urlSessionOnce_, [this] {
    const bool parallax = !userDefaults.boolean("SBLNoParallax").value_or(false);
    platform::HTTPSessionConfiguration configuration;
    configuration.label = "com.kestrel.sabled.urlSession";
    configuration.allowsCache = true;
    configuration.cacheMemoryCapacity = 4u << 20;
    configuration.cacheDiskCapacity = 100u << 20;
    configuration.tcpFastOpen = parallax;
    configuration.tlsSessionTickets = parallax;
    configuration.pipelining = true;
    configuration.idleConnectionTimeout = kIdleConnectionTimeout;
    urlSession_ = platform.httpSessions().session(configuration);
  });
  return *urlSession_;
}

platform::HTTPSession& Assembly::bagSession() {
  std::call_once(bagSessionOnce_, [this] {
    platform::HTTPSessionConfiguration configuration;
    configuration.label = "com.kestrel.sabled.bagSession";
    configuration.idleConnectionTimeout = kIdleConnectionTimeout;
    bagSession_ = platform.httpSessions().session(configuration);
  });
  return *bagSession_;
}

platform::HTTPBackgroundSession& Assembly::downloadURLSession() {
  std::call_once(downloadURLSessionOnce_, [this] {
    if (downloadSessionDelegate == nullptr) platform::programmingError("downloads without a delegate");
    platform::HTTPBackgroundSessionConfiguration configuration;
    configuration.identifier = platform::kSubsystem;
    configuration.discretionary = true;
    configuration.allowsExpensiveNetworkAccess = false;
    downloadURLSession_ =
        platform.httpSessions().backgroundSession(std::move(configuration), *downloadSessionDelegate);
  });
  return *downloadURLSession_;
}

platform::HTTPBackgroundSession& Assembly::uploadURLSession() {
  std::call_once(uploadURLSessionOnce_, [this] {
    if (uploadSessionDelegate == nullptr) platform::programmingError("uploads without a delegate");
    platform::HTTPBackgroundSessionConfiguration configuration;
    configuration.identifier = "com.kestrel.sabled.flusher.webpipe";
    configuration.discretionary = true;
    configuration.requestTimeout = std::chrono::seconds(300);
    configuration.resourceTimeout = std::chrono::seconds(604800);
    uploadURLSession_ =
        platform.httpSessions().backgroundSession(std::move(configuration), *uploadSessionDelegate);
  });
  return *uploadURLSession_;
}

}  // namespace sable
