#include "platform/host/FactFacilities.h"

#include <algorithm>
#include <array>
#include <utility>

#include "platform/host/LocaleNames.h"

namespace sable::platform::host {

namespace {

constexpr int kInputModeInUse = 12;

/// Latin layouts other than QWERTY, by language and region; "" stands for every other region.
struct Layout {
  std::string_view language, region, name;
};
constexpr std::array kLayouts{
    Layout{"fr", "CA", "QWERTY"}, Layout{"fr", "CH", "QWERTZ"}, Layout{"fr", "", "AZERTY"},
    Layout{"nl", "BE", "AZERTY"}, Layout{"de", "", "QWERTZ"},   Layout{"cs", "", "QWERTZ"},
    Layout{"hr", "", "QWERTZ"},   Layout{"hu", "", "QWERTZ"},   Layout{"sk", "", "QWERTZ"},
    Layout{"sl", "", "QWERTZ"},   Layout{"sq", "", "QWERTZ"},
};

std::string_view layoutOf(const std::string& locale) {
  const std::string language = languageOf(locale), region = regionOf(locale);
  const auto found = std::ranges::find_if(kLayouts, [&](const Layout& layout) {
    return layout.language == language && (layout.region.empty() || layout.region == region);
  });
  return found == kLayouts.end() ? "QWERTY" : found->name;
}

}  // namespace

std::optional<std::string> HostInputModes::preference(int number) const {
  if (number != kInputModeInUse) return std::nullopt;
  return facts_.string("keyboard_input_mode");
}

std::vector<std::string> HostInputModes::defaultEnabledModes() const {
  const std::string locale = facts_.localeIdentifier();
  const std::lock_guard lock(mutex_);
  if (locale_ != locale || defaultMode_.empty()) {
    locale_ = locale;
    defaultMode_ = languageTag(locale);
    std::ranges::replace(defaultMode_, '-', '_');
    defaultMode_.append("@sw=").append(layoutOf(locale));
  }
  return {defaultMode_};
}

bool HostManagedConfiguration::diagnosticsSubmissionAllowed() const {
  return facts_.boolean("diagnostics_allowed").value_or(false);
}

ManagedConfiguration::Effective HostManagedConfiguration::bookstoreAllowed() const {
  return facts_.boolean("bookstore_allowed").value_or(true) ? Effective::yes : Effective::no;
}

bool HostManagedConfiguration::mediaStoreAllowed() const {
  return facts_.boolean("media_store_allowed").value_or(true);
}

bool HostManagedConfiguration::appInstallationAllowed() const {
  return facts_.boolean("app_installation_allowed").value_or(true);
}

bool HostAccountStore::primaryAccountIsManaged() const {
  return facts_.boolean("managed_account").value_or(false);
}

std::optional<int> HostAccountStore::musicSubscriptionStatus() const {
  const auto status = facts_.integer("music_subscription_status");
  if (!status || !std::in_range<int>(*status)) return std::nullopt;
  return static_cast<int>(*status);
}

std::optional<std::string> HostAccountStore::storeFrontIdentifier() const {
  return facts_.string("storefront");
}

std::optional<MapsService::SessionEntity> HostMapsService::userSessionEntity(bool reset) {
  const auto fact = facts_.string("geo_session_id");
  if (!fact) return std::nullopt;
  const std::lock_guard lock(mutex_);
  if (reset) {
    replacedFact_ = *fact;
    session_ = runtime_.uuid().string();
  }
  const std::string& session = !session_.empty() && replacedFact_ == *fact ? session_ : *fact;
  return SessionEntity{session, session};
}

std::string HostMapsService::environmentName() const {
  return facts_.string("geo_environment").value_or("prod");
}

std::optional<std::string> HostMapsService::clientMetadata() const {
  return facts_.string("geo_metadata");
}

}  // namespace sable::platform::host
