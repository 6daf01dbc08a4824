#pragma once

#include <string>
#include <string_view>

namespace sable::platform {

inline constexpr std::string_view kCountryCodeDidChangeNotification = "CountryCodeDidChange";

/// The country the device is in (ISO 3166-1 alpha-2, upper case; "" when not known).
class CountryConfiguration {
 public:
  virtual ~CountryConfiguration() = default;
  virtual std::string countryCode() const = 0;
};

}  // namespace sable::platform
