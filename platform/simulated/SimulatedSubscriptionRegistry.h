#pragma once

#include <algorithm>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/NotificationCenter.h"
#include "platform/SubscriptionRegistry.h"

namespace sable::platform::simulated {

/// Answers a second later with what a test has put into it.
class SimulatedSubscriptionRegistry final : public SubscriptionRegistry {
 public:
  SimulatedSubscriptionRegistry(Runtime& runtime, NotificationCenter& center)
      : runtime_(runtime), center_(center) {}

  std::optional<Error> failure;  ///< answered instead

  void change(std::vector<Subscription> subscriptions) {
    subscriptions_ = std::move(subscriptions);
    center_.post({kSubscriptionRegistryDidUpdateNotification, this, {}});
  }

  void activeSubscriptions(std::vector<std::string> providers, std::vector<std::string> domains,
                           Function<void(Expected<std::vector<Subscription>>)> answer) override {
    std::vector<Subscription> found;
    const auto has = [](const std::vector<std::string>& list, const std::string& item) {
      return std::ranges::find(list, item) != list.end();
    };
    std::ranges::copy_if(subscriptions_, std::back_inserter(found), [&](const Subscription& each) {
      return has(providers, each.provider) || has(domains, each.domain);
    });
    runtime_.globalQueue(QualityOfService::background)
        .after(std::chrono::seconds(1),
               [found = std::move(found), error = failure, answer = std::move(answer)]() mutable {
                 if (error) return answer(tl::unexpected(*error));
                 answer(std::move(found));
               })
        .detach();
  }

 private:
  Runtime& runtime_;
  NotificationCenter& center_;
  std::vector<Subscription> subscriptions_;
};

}  // namespace sable::platform::simulated
