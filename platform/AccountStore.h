#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable::platform {

// Posted when the answer to one of the questions, in the order below, has become another.
inline constexpr std::string_view kAccountStoreDidChangeNotification = "AccountStoreDidChange";
inline constexpr std::string_view kMusicSubscriptionStatusDidChangeNotification =
    "MusicSubscriptionStatusDidChange";
inline constexpr std::string_view kStoreFrontDidChangeNotification = "StoreFrontDidChange";

/// The primary account of the device's user.
class AccountStore {
 public:
  virtual ~AccountStore() = default;
  virtual bool primaryAccountIsManaged() const = 0;
  /// The store account's last known status of the maker's music subscription; 3: subscribed.
  virtual std::optional<int> musicSubscriptionStatus() const = 0;
  virtual std::optional<std::string> storeFrontIdentifier() const = 0;
};

}  // namespace sable::platform
