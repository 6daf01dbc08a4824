#pragma once

#include <string>

#include "platform/LocaleInfo.h"
#include "platform/host/HostFacts.h"

namespace sable::platform::host {

/// Facts first, then the environment; what follows from the locale comes from ICU, whose data are
/// loaded by the first question that needs them (calendar, measurement, temperature, hours).
class HostLocaleInfo final : public LocaleInfo {
 public:
  explicit HostLocaleInfo(const HostFacts& facts) : facts_(facts) {}

  std::string localeIdentifier() const override;
  std::string calendarIdentifier() const override;
  std::string measurementSystem() const override;
  std::optional<std::string> temperatureUnit() const override;
  std::vector<std::string> preferredLanguages() const override;
  std::string systemLanguage() const override;
  std::string hourPattern() const override;
  std::string timeZoneName() const override;
  std::int64_t dayNumber(WallTime time) const override;

 private:
  const HostFacts& facts_;
};

}  // namespace sable::platform::host
