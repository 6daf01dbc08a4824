#pragma once

#include <memory>
#include <mutex>

#include "platform/Platform.h"

namespace sable::platform {
class HTTPBackgroundSession;
class HTTPBackgroundSessionDelegate;
class HTTPSession;
}  // namespace sable::platform

namespace sable {

class AppWhitelistController;
class BackgroundFlusher;
class ClientSessionManager;
class ClientStateManager;
class DownloadManager;
class ImageFetcher;
class Lookup;
class SBLNetworkRequestFactory;
class SableBagController;
class SableFeedbackFlusher;
class SableFlusherRelay;
class SablePersistentStorage;
class SableSubscriptionManager;
class SableUserGUIDController;

/// Holds every long-lived service and setting of the daemon. Services are made in the order of
/// start-up, reach each other only through here, and live as long as the process. A service that
/// this build or device does not have is null; its users go on without it.
class Assembly {
 public:
  explicit Assembly(platform::Platform& platform);
  ~Assembly();
  Assembly(const Assembly&) = delete;
  Assembly& operator=(const Assembly&) = delete;

  platform::Platform& platform;
  platform::Runtime& runtime;
  platform::UserDefaults& userDefaults;
  platform::FileManager& fileManager;
  platform::NotificationCenter& notificationCenter;
  platform::Tally& tally;

  bool sharedSession = false;  ///< one feedback session for all clients instead of one per client
  bool testFeedbacks = false;  ///< sessions keep their feedback in memory, too

  // Destroyed in reverse order: what is built on others goes first.
  std::unique_ptr<SBLNetworkRequestFactory> requestFactory;
  std::unique_ptr<SableSubscriptionManager> subscriptionManager;
  std::unique_ptr<DownloadManager> downloadManager;
  std::unique_ptr<SablePersistentStorage> persistentStorage;
  std::unique_ptr<SableFeedbackFlusher> crowdsourcingFeedbackFlusher;
  std::unique_ptr<BackgroundFlusher> backgroundFlusher;
  std::unique_ptr<SableUserGUIDController> guidController;
  /// Of the daemon itself, and of all clients where they share a session.
  std::unique_ptr<ClientSessionManager> clientSessionManager;
  std::unique_ptr<SableFlusherRelay> flusherRelayListener;
  std::unique_ptr<ImageFetcher> imageFetcher;
  std::unique_ptr<Lookup> lookup;
  std::unique_ptr<SableBagController> bagController;
  std::unique_ptr<ClientStateManager> clientStateManager;
  std::unique_ptr<AppWhitelistController> appWhitelistController;

  /// Whether the bag is mirrored to disk. Deliberately no setting.
  bool diskBagCacheEnabled() const { return true; }
  /// The setting "SBLUseBramble", read anew at each call.
  bool useBramble() const;

  // HTTP sessions, each made at its first use, once. Any thread.
  platform::HTTPSession& urlSession();  ///< searches, warm-up, images; with a response cache
  platform::HTTPSession& bagSession();  ///< bag fetches; without a cache

  // Background sessions, likewise. Their delegates are services: each sets its own here before anyone
  // asks for the session, and asks for it itself at start-up, so that what an earlier process has left
  // goes on. It must be ready to be called by then, on the session's callback queue.
  platform::HTTPBackgroundSessionDelegate* downloadSessionDelegate = nullptr;  ///< downloadManager
  platform::HTTPBackgroundSessionDelegate* uploadSessionDelegate = nullptr;    ///< backgroundFlusher
  platform::HTTPBackgroundSession& downloadURLSession();                       ///< resources
  platform::HTTPBackgroundSession& uploadURLSession();                         ///< feedback

 private:
  // Destroyed first: delegates outlive their sessions.
  std::once_flag urlSessionOnce_, bagSessionOnce_, downloadURLSessionOnce_, uploadURLSessionOnce_;
  std::unique_ptr<platform::HTTPSession> urlSession_, bagSession_;
  std::unique_ptr<platform::HTTPBackgroundSession> downloadURLSession_, uploadURLSession_;
};

}  // namespace sable
