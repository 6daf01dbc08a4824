#include "platform/host/HostFacts.h"

#include <nlohmann/json.hpp>
#include <vector>

#include "platform/AccountStore.h"
#include "platform/ApplicationRegistry.h"
#include "platform/BackgroundTransfers.h"
#include "platform/CountryConfiguration.h"
#include "platform/LocaleInfo.h"
#include "platform/ManagedConfiguration.h"
#include "platform/MapsService.h"
#include "platform/SubscriptionRegistry.h"
#include "platform/TimedActivityScheduler.h"
#include "platform/host/LocaleNames.h"

namespace sable::platform::host {

namespace {

using Answer = std::string (HostFacts::*)() const;

/// A notification, and what makes up the answers it stands for: facts by key, and one that the
/// host may answer.
struct Subject {
  std::string_view notification;
  std::vector<std::string_view> keys;
  Answer answer = nullptr;
};

const std::vector<Subject>& subjects() {
  static const std::vector<Subject> all{
      Subject{kCurrentLocaleDidChangeNotification,
              {"calendar", "measurement_system", "temperature_unit", "preferred_languages", "system_language",
               "hour_cycle_24"},
              &HostFacts::localeIdentifier},
      Subject{kSystemTimeZoneDidChangeNotification, {}, &HostFacts::timeZoneName},
      Subject{kCountryCodeDidChangeNotification, {}, &HostFacts::countryCode},
      Subject{
          kEffectiveSettingsDidChangeNotification,
          {"diagnostics_allowed", "bookstore_allowed", "media_store_allowed", "app_installation_allowed"}},
      Subject{kAccountStoreDidChangeNotification, {"managed_account"}},
      Subject{kMusicSubscriptionStatusDidChangeNotification, {"music_subscription_status"}},
      Subject{kStoreFrontDidChangeNotification, {"storefront"}},
      Subject{kSubscriptionRegistryDidUpdateNotification, {"subscriptions"}},
      Subject{kMapsServiceDidChangeNotification, {"geo_session_id", "geo_environment", "geo_metadata"}},
      Subject{kLocationFactsDidChangeNotification, {"location"}},
      Subject{kPowerSourceDidChangeNotification, {"on_battery"}},
      Subject{kApplicationsDidChangeNotification, {"applications"}},
      Subject{kNetworkCostDidChangeNotification, {"metered"}},
  };
  return all;
}

}  // namespace

HostFacts::HostFacts(const Folders& folders, HostSources sources, Reactor& reactor,
                     NotificationCenter& notificationCenter)
    : sources_(std::move(sources)),
      notificationCenter_(notificationCenter),
      system_(folders.systemFacts),
      user_(folders.userFacts()) {
  watcher_ = std::make_unique<FileWatcher>(
      reactor,
      std::vector<std::filesystem::path>{folders.systemFacts, folders.userFacts(),
                                         sources_.root / "etc/localtime", sources_.root / "etc/timezone"},
      [this] { reload(); });
  reload();
}

HostFacts::~HostFacts() = default;

void HostFacts::reload() {
  const std::lock_guard turn(reloading_);
  system_.reload();
  user_.reload();
  Dictionary merged = Dictionary::object();
  for (const FactsFile* layer : {&system_, &user_}) {
    for (const auto& [name, value] : layer->facts()) merged[name] = *value.value;
  }
  {
    const std::lock_guard lock(mutex_);
    facts_ = std::make_shared<const Dictionary>(std::move(merged));
  }
  const auto before = std::exchange(answers_, answers());
  for (std::size_t i = 0; i < before.size(); ++i) {
    if (before[i] != answers_[i]) notificationCenter_.post({subjects()[i].notification, this, {}});
  }
}

bool HostFacts::areReadable() {
  const std::lock_guard turn(reloading_);
  return !system_.isDamaged() && !user_.isDamaged();
}

std::vector<std::string> HostFacts::answers() const {
  const auto current = facts();
  std::vector<std::string> all;
  for (const Subject& subject : subjects()) {
    Dictionary answer = Dictionary::array();
    if (subject.answer != nullptr) answer.push_back((this->*subject.answer)());
    for (const std::string_view key : subject.keys) {
      const auto found = current->find(std::string(key));
      answer.push_back(found == current->end() ? Dictionary() : *found);
    }
    all.push_back(compactJSON(answer));
  }
  return all;
}

std::shared_ptr<const Dictionary> HostFacts::facts() const {
  const std::lock_guard lock(mutex_);
  return facts_;
}

std::optional<std::string> HostFacts::string(std::string_view key) const {
  return stringMember(*facts(), key);
}
std::optional<bool> HostFacts::boolean(std::string_view key) const {
  return booleanMember(*facts(), key);
}
std::optional<std::int64_t> HostFacts::integer(std::string_view key) const {
  return integerMember(*facts(), key);
}
std::optional<double> HostFacts::number(std::string_view key) const {
  return numberMember(*facts(), key);
}
std::optional<std::vector<std::string>> HostFacts::strings(std::string_view key) const {
  return stringsMember(*facts(), key);
}

std::shared_ptr<const Dictionary> HostFacts::find(std::string_view key,
                                                  bool (Dictionary::*is)() const noexcept) const {
  auto all = facts();
  const auto found = all->find(key);
  if (found == all->end() || !((*found).*is)()) return nullptr;
  return {std::move(all), &*found};
}

std::shared_ptr<const Dictionary> HostFacts::table(std::string_view key) const {
  return find(key, &Dictionary::is_object);
}
std::shared_ptr<const Dictionary> HostFacts::tables(std::string_view key) const {
  return find(key, &Dictionary::is_array);
}

std::string HostFacts::localeIdentifier() const {
  if (auto fact = string("locale")) return *fact;
  return localeIdentifierOfHost(sources_.environment);
}

std::string HostFacts::countryCode() const {
  if (auto fact = string("country_code")) return *fact;
  return regionOf(localeIdentifier());
}

std::string HostFacts::timeZoneName() const {
  if (auto fact = string("time_zone")) return *fact;
  return timeZoneOfHost(sources_.environment, sources_.root);
}

}  // namespace sable::platform::host
