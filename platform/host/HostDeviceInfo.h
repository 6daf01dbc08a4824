#pragma once

#include "platform/DeviceInfo.h"
#include "platform/host/HostFacts.h"

namespace sable::platform::host {

/// ProductType from DMI or the device tree ("Linux" without either), ProductName and BuildVersion
/// from os-release(5): NAME, and VERSION_ID or BUILD_ID; facts first.
class HostDeviceInfo final : public DeviceInfo {
 public:
  explicit HostDeviceInfo(const HostFacts& facts);

  std::string answer(std::string_view question) const override;
  double mainScreenScale() const override;

 private:
  const HostFacts& facts_;
  const std::string productType_, productName_, buildVersion_;
};

}  // namespace sable::platform::host
