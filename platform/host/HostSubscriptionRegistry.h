#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/NotificationCenter.h"
#include "platform/SubscriptionRegistry.h"
#include "platform/host/FileWatcher.h"
#include "platform/host/HostFacts.h"

namespace sable::platform::host {

/// Subscriptions from the files *.toml in the folders that providers write to, the system's and then
/// the user's, and after them those of the facts; all have the same form. The files are read, and
/// watched from then on, when somebody first asks.
class HostSubscriptionRegistry final : public SubscriptionRegistry {
 public:
  HostSubscriptionRegistry(const Folders& folders, const HostFacts& facts, Runtime& runtime, Reactor& reactor,
                           NotificationCenter& notificationCenter);
  ~HostSubscriptionRegistry() override;

  void activeSubscriptions(std::vector<std::string> providers, std::vector<std::string> domains,
                           Function<void(Expected<std::vector<Subscription>>)> answer) override;

 private:
  void watch();
  /// Whether something is different now.
  bool reload();
  std::vector<std::filesystem::path> paths() const;
  std::vector<Subscription> all();

  const std::vector<std::filesystem::path> folders_;
  const HostFacts& facts_;
  Reactor& reactor_;
  NotificationCenter& notificationCenter_;
  const std::shared_ptr<SerialQueue> queue_;

  std::mutex mutex_;
  /// In the order of their precedence, later ones over earlier ones.
  std::vector<FactsFile> files_;

  std::unique_ptr<FileWatcher> watcher_;  ///< made on queue_
};

}  // namespace sable::platform::host
