#pragma once

#include <string_view>

namespace sable::platform {

inline constexpr std::string_view kEffectiveSettingsDidChangeNotification = "EffectiveSettingsDidChange";

/// What whoever manages the device allows on it.
class ManagedConfiguration {
 public:
  virtual ~ManagedConfiguration() = default;

  enum class Effective { unset = 0, yes = 1, no = 2 };

  virtual bool diagnosticsSubmissionAllowed() const = 0;
  virtual Effective bookstoreAllowed() const = 0;
  virtual bool mediaStoreAllowed() const = 0;
  virtual bool appInstallationAllowed() const = 0;
};

}  // namespace sable::platform
