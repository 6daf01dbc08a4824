#pragma once

#include <memory>

#include "platform/Error.h"
#include "platform/Process.h"
#include "platform/Relay.h"
#include "sabled/Assembly.h"

namespace sable {

class SableDPAppDeepLinkIngester;
class SableService;

/// The daemon as a whole, on whatever platform it is given: makes the services in their order,
/// opens the listener and waits for signals. One per device, for the life of the process.
class SableDaemon {
 public:
  explicit SableDaemon(platform::Platform& platform);
  ~SableDaemon();

  /// Starts up; fails when the listener cannot be opened. Clients can connect afterwards.
  Expected<void> start();

  Assembly& assembly() { return assembly_; }
  SableService& service() { return *service_; }

 private:
  void registerDefaults();
  void createServices();
  Expected<void> openListener();
  void installLaunchEventHandlers();
  void loadBagEarly();
  void postStartup();
  void installSignalHandlers();
  void logAvailability();

  platform::Platform& platform_;
  Assembly assembly_;
  std::unique_ptr<SableDPAppDeepLinkIngester> deepLinkIngester_;
  std::unique_ptr<SableService> service_;
  std::unique_ptr<platform::RelayListener> listener_;
  std::unique_ptr<platform::Process::SignalSource> interrupt_, terminate_;
};

}  // namespace sable
