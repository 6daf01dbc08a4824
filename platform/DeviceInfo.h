#pragma once

#include <string>
#include <string_view>

namespace sable::platform {

/// What the device is. Facts do not change while the daemon runs, but for the facts file.
class DeviceInfo {
 public:
  virtual ~DeviceInfo() = default;
  /// Answers "ProductType", "ProductName" and "BuildVersion"; other questions, and what the host
  /// does not know, are "".
  virtual std::string answer(std::string_view question) const = 0;
  /// Pixels per point of the main screen; 1 when the host cannot tell.
  virtual double mainScreenScale() const = 0;
};

}  // namespace sable::platform
