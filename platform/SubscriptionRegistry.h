#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/Runtime.h"

namespace sable::platform {

/// Posted when what the registry would answer may have become something else.
inline constexpr std::string_view kSubscriptionRegistryDidUpdateNotification =
    "SubscriptionRegistryDidUpdate";

/// That the device's user subscribes to a service.
struct Subscription {
  std::string provider;             ///< identifier of the application that registered it
  std::string domain;               ///< the provider's, on the web; may be empty
  std::optional<std::string> info;  ///< in the provider's words: "premium"
  WallTime modified;                ///< when the provider last said so
};

/// What providers of services have registered about their subscribers.
class SubscriptionRegistry {
 public:
  virtual ~SubscriptionRegistry() = default;

  /// Answers with the active subscriptions of those providers whose identifier is among `providers`
  /// or whose domain is among `domains`; of two with one identifier the later one counts. Returns
  /// at once; `answer` is called exactly once, on a queue of the registry's. Any thread.
  virtual void activeSubscriptions(std::vector<std::string> providers, std::vector<std::string> domains,
                                   Function<void(Expected<std::vector<Subscription>>)> answer) = 0;
};

}  // namespace sable::platform
