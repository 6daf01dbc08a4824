#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace sable::platform {

/// Posted when applications were installed, updated or removed, perhaps.
inline constexpr std::string_view kApplicationsDidChangeNotification = "ApplicationsDidChange";

struct InstalledApplication {
  std::string bundleIdentifier;  ///< "org.example.Mail"; empty when it has none
  std::string bundleVersion;     ///< "3.2"; empty when nobody knows

  friend bool operator==(const InstalledApplication&, const InstalledApplication&) = default;
};

/// The applications of the device. Changes are posted as long as the registry exists. Any thread.
class ApplicationRegistry {
 public:
  virtual ~ApplicationRegistry() = default;

  /// What is installed now, in no particular order. May wait for the disk.
  virtual std::vector<InstalledApplication> installedApplications() = 0;
};

}  // namespace sable::platform
