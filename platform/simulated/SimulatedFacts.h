#pragma once

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/AccountStore.h"
#include "platform/ApplicationRegistry.h"
#include "platform/CountryConfiguration.h"
#include "platform/DeviceInfo.h"
#include "platform/InputModes.h"
#include "platform/LocaleInfo.h"
#include "platform/ManagedConfiguration.h"
#include "platform/MapsService.h"
#include "platform/NotificationCenter.h"

/// The facts of a virtual device. A test writes `values` and, where the facility has a notification,
/// calls change(), which posts it as the host would.
namespace sable::platform::simulated {

class SimulatedDeviceInfo final : public DeviceInfo {
 public:
  std::map<std::string, std::string, std::less<>> answers{
      {"ProductType", "SableBook1,1"}, {"ProductName", "Sable OS"}, {"BuildVersion", "1A1"}};
  double scale = 2;

  std::string answer(std::string_view question) const override {
    const auto found = answers.find(question);
    return found == answers.end() ? "" : found->second;
  }
  double mainScreenScale() const override { return scale; }
};

class SimulatedLocaleInfo final : public LocaleInfo {
 public:
  struct Values {
    std::string localeIdentifier = "en_US";
    std::string calendarIdentifier = "gregorian";
    std::string measurementSystem = "U.S.";
    std::optional<std::string> temperatureUnit = "Fahrenheit";
    std::vector<std::string> preferredLanguages = {"en-US"};
    std::string systemLanguage = "en-US";
    std::string hourPattern = "h a";
    std::string timeZoneName = "America/Los_Angeles";
    std::chrono::seconds utcOffset = std::chrono::hours(-8);  ///< of the zone, all year round
  };
  Values values;

  explicit SimulatedLocaleInfo(NotificationCenter& center) : center_(center) {}

  /// The user changes the locale, its parts, or the languages.
  void change(Values changed) {
    const bool zone = changed.timeZoneName != values.timeZoneName;
    values = std::move(changed);
    center_.post({kCurrentLocaleDidChangeNotification, this, {}});
    if (zone) center_.post({kSystemTimeZoneDidChangeNotification, this, {}});
  }
  /// The device travels.
  void changeTimeZone(std::string name) {
    values.timeZoneName = std::move(name);
    center_.post({kSystemTimeZoneDidChangeNotification, this, {}});
  }

  std::string localeIdentifier() const override { return values.localeIdentifier; }
  std::string calendarIdentifier() const override { return values.calendarIdentifier; }
  std::string measurementSystem() const override { return values.measurementSystem; }
  std::optional<std::string> temperatureUnit() const override { return values.temperatureUnit; }
  std::vector<std::string> preferredLanguages() const override { return values.preferredLanguages; }
  std::string systemLanguage() const override { return values.systemLanguage; }
  std::string hourPattern() const override { return values.hourPattern; }
  std::string timeZoneName() const override { return values.timeZoneName; }
  std::int64_t dayNumber(WallTime time) const override {
    return std::chrono::floor<std::chrono::days>(time + values.utcOffset).time_since_epoch().count();
  }

 private:
  NotificationCenter& center_;
};

class SimulatedInputModes final : public InputModes {
 public:
  std::map<int, std::string> preferences{{12, "en_US@sw=QWERTY"}};
  std::vector<std::string> enabledModes{"en_US@sw=QWERTY"};

  std::optional<std::string> preference(int number) const override {
    const auto found = preferences.find(number);
    return found == preferences.end() ? std::nullopt : std::optional(found->second);
  }
  std::vector<std::string> defaultEnabledModes() const override { return enabledModes; }
};

class SimulatedCountryConfiguration final : public CountryConfiguration {
 public:
  explicit SimulatedCountryConfiguration(NotificationCenter& center) : center_(center) {}

  void change(std::string code) {
    code_ = std::move(code);
    center_.post({kCountryCodeDidChangeNotification, this, {}});
  }
  std::string countryCode() const override { return code_; }

 private:
  NotificationCenter& center_;
  std::string code_ = "US";
};

class SimulatedManagedConfiguration final : public ManagedConfiguration {
 public:
  struct Values {
    bool diagnosticsAllowed = true;
    Effective bookstoreAllowed = Effective::yes;
    bool mediaStoreAllowed = true;
    bool appInstallationAllowed = true;
  };
  Values values;

  explicit SimulatedManagedConfiguration(NotificationCenter& center) : center_(center) {}

  void change(Values changed) {
    values = changed;
    center_.post({kEffectiveSettingsDidChangeNotification, this, {}});
  }
  bool diagnosticsSubmissionAllowed() const override { return values.diagnosticsAllowed; }
  Effective bookstoreAllowed() const override { return values.bookstoreAllowed; }
  bool mediaStoreAllowed() const override { return values.mediaStoreAllowed; }
  bool appInstallationAllowed() const override { return values.appInstallationAllowed; }

 private:
  NotificationCenter& center_;
};

class SimulatedAccountStore final : public AccountStore {
 public:
  struct Values {
    bool managed = false;
    std::optional<int> musicSubscriptionStatus;
    std::optional<std::string> storeFrontIdentifier;
  };
  Values values;

  explicit SimulatedAccountStore(NotificationCenter& center) : center_(center) {}

  void change(Values changed) {
    const Values before = std::exchange(values, std::move(changed));
    if (values.managed != before.managed) center_.post({kAccountStoreDidChangeNotification, this, {}});
    if (values.musicSubscriptionStatus != before.musicSubscriptionStatus)
      center_.post({kMusicSubscriptionStatusDidChangeNotification, this, {}});
    if (values.storeFrontIdentifier != before.storeFrontIdentifier)
      center_.post({kStoreFrontDidChangeNotification, this, {}});
  }
  bool primaryAccountIsManaged() const override { return values.managed; }
  std::optional<int> musicSubscriptionStatus() const override { return values.musicSubscriptionStatus; }
  std::optional<std::string> storeFrontIdentifier() const override { return values.storeFrontIdentifier; }

 private:
  NotificationCenter& center_;
};

/// Hands out the sessions a test has prepared; a reset moves on to the next one, if there is one.
class SimulatedMapsService final : public MapsService {
 public:
  std::vector<SessionEntity> sessions;  ///< empty: there is no maps service
  std::string environment = "prod";

  explicit SimulatedMapsService(NotificationCenter& center) : center_(center) {}

  void changeMetadata(std::optional<std::string> metadata) {
    metadata_ = std::move(metadata);
    center_.post({kMapsServiceDidChangeNotification, this, {}});
  }

  std::optional<SessionEntity> userSessionEntity(bool reset) override {
    if (reset) ++resets_;
    if (reset && current_ + 1 < sessions.size()) ++current_;
    return sessions.empty() ? std::nullopt : std::optional(sessions[current_]);
  }
  std::string environmentName() const override { return environment; }
  std::optional<std::string> clientMetadata() const override { return metadata_; }

  int resets() const { return resets_; }

 private:
  NotificationCenter& center_;
  std::optional<std::string> metadata_;
  std::size_t current_ = 0;
  int resets_ = 0;
};

class SimulatedApplicationRegistry final : public ApplicationRegistry {
 public:
  explicit SimulatedApplicationRegistry(NotificationCenter& center) : center_(center) {}

  /// The user installs, updates and removes applications; these are there afterwards.
  void change(std::vector<InstalledApplication> applications) {
    applications_ = std::move(applications);
    center_.post({kApplicationsDidChangeNotification, this, {}});
  }
  std::vector<InstalledApplication> installedApplications() override {
    ++enumerations_;
    return applications_;
  }

  int enumerations() const { return enumerations_; }

 private:
  NotificationCenter& center_;
  std::vector<InstalledApplication> applications_;
  int enumerations_ = 0;
};

}  // namespace sable::platform::simulated
