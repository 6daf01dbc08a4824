#include "sabled/SableSubscriptionManager.h"

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "platform/AccountStore.h"
#include "sabled/Assembly.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

constexpr int kSubscribed = 3;  ///< an account's status of the music subscription
constexpr const char* kEmber = "ember";

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategorySubscription);
}

}  // namespace

SableSubscriptionManager::SableSubscriptionManager(Assembly& assembly,
                                                   SableSubscriptionManagerDelegate& delegate)
    : assembly_(assembly),
      delegate_(delegate),
      queue_(assembly.runtime.serialQueue("com.kestrel.sable.subscriptionsByProvider-Queue")) {
  observe();
  _initializeStorefront();
}

SableSubscriptionManager::~SableSubscriptionManager() = default;

void SableSubscriptionManager::observe() {
  const auto on = [this](std::string_view name, auto handler) {
    observations_.push_back(assembly_.notificationCenter.observe(std::string(name), handler));
  };
  using platform::Notification;
  on(platform::kSubscriptionRegistryDidUpdateNotification,
     [this](const Notification&) { _thirdPartyNotificationDidUpdate(); });
  on(kSBLBagChangeNotification,
     [this](const Notification& notification) { _bagChangeNotification(notification); });
  on(platform::kMusicSubscriptionStatusDidChangeNotification,
     [this](const Notification&) { _subscriptionChanged(); });
  on(platform::kStoreFrontDidChangeNotification, [this](const Notification&) { _storefrontChanged(); });
}

Dictionary SableSubscriptionManager::subscriptions() const {
  return queue_->sync([this] { return values(); });
}

Dictionary SableSubscriptionManager::values() const {
  Dictionary list = Dictionary::array();
  for (const auto& [provider, subscription] : subscriptionsByProvider_) list.push_back(subscription);
  return list;
}

void SableSubscriptionManager::_initializeStorefront() {
  // Waited for, so that the first request already carries it.
  queue_->sync([this] { _updateStorefrontIdentifier(storefrontOfDevice()); });
}

void SableSubscriptionManager::_storefrontChanged() {
  queue_->async([this] { _updateStorefrontIdentifier(storefrontOfDevice()); });
}

std::string SableSubscriptionManager::storefrontOfDevice() const {
  return assembly_.platform.accountStore().storeFrontIdentifier().value_or("");
}

void SableSubscriptionManager::_updateStorefrontIdentifier(std::string identifier) {
  queue_->assertIsCurrent();
  storefrontIdentifier_ = std::move(identifier);
  delegate_.didUpdateStorefrontIdentifier(*this, storefrontIdentifier_);
}

void SableSubscriptionManager::_bagChangeNotification(const platform::Notification& notification) {
  queue_->async([this, bag = bagFromNotification(notification)] {
    bag_ = bag;
    _updateSubscriptions();
  });
}

void SableSubscriptionManager::_thirdPartyNotificationDidUpdate() {
  queue_->async([this] { _updateSubscriptions(); });
}

void SableSubscriptionManager::_subscriptionChanged() {
  queue_->async([this] { _updateSubscriptions(); });
}

void SableSubscriptionManager::_updateSubscriptions() {
  queue_->assertIsCurrent();
  log().standard("updating subscription info");
  if (bag_ == nullptr || !bag_->subscriptionProviderDomainWhitelist() ||
      !bag_->subscriptionProviderBundleIdentifierWhitelist()) {
    subscriptionsByProvider_.clear();
    return delegate_.didUpdateSubscriptionDictionaries(*this, values());
  }
  std::map<std::string, Dictionary> updated;
  for (const auto& subscription :
       registeredSubscriptions(*bag_->subscriptionProviderBundleIdentifierWhitelist(),
                               *bag_->subscriptionProviderDomainWhitelist())) {
    Dictionary entry{{"provider", subscription.provider}};
    if (subscription.info) entry["type"] = *subscription.info;
    entry["active"] = isActive(subscription);
    updated.insert_or_assign(subscription.provider, std::move(entry));
  }
  if (_getEmberSubscribed()) {
    updated.insert_or_assign(kEmber,
                             Dictionary{{"provider", kEmber}, {"attribute", "premium"}, {"active", true}});
  }
  if (updated == subscriptionsByProvider_) return;
  subscriptionsByProvider_ = std::move(updated);
  delegate_.didUpdateSubscriptionDictionaries(*this, values());
}

SableSubscriptionManager::Subscriptions SableSubscriptionManager::registeredSubscriptions(
    std::vector<std::string> providers, std::vector<std::string> domains) const {
  Expected<Subscriptions> answer;
  const std::shared_ptr<platform::WaitGroup> group = assembly_.runtime.waitGroup();
  group->enter();
  assembly_.platform.subscriptionRegistry().activeSubscriptions(
      std::move(providers), std::move(domains), [&answer, group](Expected<Subscriptions> found) {
        answer = std::move(found);
        group->leave();
      });
  static_cast<void>(group->wait(platform::MonotonicTime::max()));
  if (answer) return *std::move(answer);
  log().error("Error fetching third party subscription information from daemon: {}",
              answer.error().description());
  return {};
}

bool SableSubscriptionManager::_getEmberSubscribed() const {
  return assembly_.platform.accountStore().musicSubscriptionStatus() == kSubscribed;
}

bool SableSubscriptionManager::isActive(const platform::Subscription& subscription) const {
  const platform::WallTime now = assembly_.runtime.now();
  if (subscription.modified > now) return false;
  return platform::toSeconds(now - subscription.modified) <= bag_->subscriptionTTL();
}

}  // namespace sable
