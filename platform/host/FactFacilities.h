#pragma once

#include <mutex>

#include "platform/AccountStore.h"
#include "platform/CountryConfiguration.h"
#include "platform/InputModes.h"
#include "platform/ManagedConfiguration.h"
#include "platform/MapsService.h"
#include "platform/host/HostFacts.h"

/// Facilities for which a Linux host has no source of its own, or only the locale: they answer
/// from the facts files. What no file says is stated at each.
namespace sable::platform::host {

/// No mode in use; one enabled mode, the locale's with its usual Latin layout.
class HostInputModes final : public InputModes {
 public:
  explicit HostInputModes(const HostFacts& facts) : facts_(facts) {}
  std::optional<std::string> preference(int number) const override;
  std::vector<std::string> defaultEnabledModes() const override;

 private:
  const HostFacts& facts_;

  // Asked for with every keystroke.
  mutable std::mutex mutex_;
  mutable std::string locale_, defaultMode_;
};

/// The locale's region.
class HostCountryConfiguration final : public CountryConfiguration {
 public:
  explicit HostCountryConfiguration(const HostFacts& facts) : facts_(facts) {}
  std::string countryCode() const override { return facts_.countryCode(); }

 private:
  const HostFacts& facts_;
};

/// Nothing is forbidden, but diagnostics are not submitted unasked.
class HostManagedConfiguration final : public ManagedConfiguration {
 public:
  explicit HostManagedConfiguration(const HostFacts& facts) : facts_(facts) {}
  bool diagnosticsSubmissionAllowed() const override;
  Effective bookstoreAllowed() const override;
  bool mediaStoreAllowed() const override;
  bool appInstallationAllowed() const override;

 private:
  const HostFacts& facts_;
};

/// An account that nobody manages, without subscription or store.
class HostAccountStore final : public AccountStore {
 public:
  explicit HostAccountStore(const HostFacts& facts) : facts_(facts) {}
  bool primaryAccountIsManaged() const override;
  std::optional<int> musicSubscriptionStatus() const override;
  std::optional<std::string> storeFrontIdentifier() const override;

 private:
  const HostFacts& facts_;
};

/// No maps service, environment "prod". The session that the facts name serves until it is reset;
/// then sessions are drawn at random, until the facts name another.
class HostMapsService final : public MapsService {
 public:
  HostMapsService(Runtime& runtime, const HostFacts& facts) : runtime_(runtime), facts_(facts) {}
  std::optional<SessionEntity> userSessionEntity(bool reset) override;
  std::string environmentName() const override;
  std::optional<std::string> clientMetadata() const override;

 private:
  Runtime& runtime_;
  const HostFacts& facts_;

  std::mutex mutex_;
  std::string replacedFact_;  ///< that session_ stands in for
  std::string session_;
};

}  // namespace sable::platform::host
