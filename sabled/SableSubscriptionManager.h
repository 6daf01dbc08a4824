#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"
#include "platform/SubscriptionRegistry.h"

namespace sable {

class Assembly;
class SBLBag;
class SableSubscriptionManager;

/// Who is told what the user subscribes to. Called on the manager's queue; must not call it back.
class SableSubscriptionManagerDelegate {
 public:
  virtual ~SableSubscriptionManagerDelegate() = default;
  /// `subscriptions`: an array of them, see SableSubscriptionManager.
  virtual void didUpdateSubscriptionDictionaries(const SableSubscriptionManager& manager,
                                                 const Dictionary& subscriptions) = 0;
  /// "" where there is no store.
  virtual void didUpdateStorefrontIdentifier(const SableSubscriptionManager& manager,
                                             const std::string& identifier) = 0;
};

/// Gathers which of the providers that the bag names the user subscribes to, and the account's store
/// front, and tells both to its delegate when they change. A subscription is an object: "provider",
/// "type" (as the provider registered it; may be absent) and "active", which is false for one that
/// the provider has not confirmed within the bag's subscriptionTTL. Any thread.
class SableSubscriptionManager {
 public:
  /// `delegate` outlives the manager, and has the store front when this returns.
  SableSubscriptionManager(Assembly& assembly, SableSubscriptionManagerDelegate& delegate);
  ~SableSubscriptionManager();

  /// An array. Waits for an update that is under way.
  Dictionary subscriptions() const;

 private:
  using Subscriptions = std::vector<platform::Subscription>;

  void observe();
  void _initializeStorefront();
  void _thirdPartyNotificationDidUpdate();
  void _bagChangeNotification(const platform::Notification& notification);
  void _subscriptionChanged();
  void _storefrontChanged();

  // On queue_.
  void _updateSubscriptions();
  Subscriptions registeredSubscriptions(std::vector<std::string> providers,
                                        std::vector<std::string> domains) const;
  bool _getEmberSubscribed() const;
  bool isActive(const platform::Subscription& subscription) const;
  Dictionary values() const;
  std::string storefrontOfDevice() const;
  void _updateStorefrontIdentifier(std::string identifier);

  Assembly& assembly_;
  SableSubscriptionManagerDelegate& delegate_;
  const std::shared_ptr<platform::SerialQueue> queue_;

  // On queue_.
  std::map<std::string, Dictionary> subscriptionsByProvider_;
  std::shared_ptr<const SBLBag> bag_;
  std::string storefrontIdentifier_;

  std::vector<platform::NotificationCenter::Token> observations_;
};

}  // namespace sable
