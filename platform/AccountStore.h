#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable::platform {

inline constexpr std::string_view kAccountStoreDidChangeNotification = "AccountStoreDidChange";

/// The primary account of the device's user.
class AccountStore {
 public:
  virtual ~AccountStore() = default;
  virtual bool primaryAccountIsManaged() const = 0;
  virtual std::optional<int> musicSubscriptionStatus() const = 0;
  virtual std::optional<std::string> storeFrontIdentifier() const = 0;
};

}  // namespace sable::platform
