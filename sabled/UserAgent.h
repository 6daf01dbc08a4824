#pragma once

#include <string>
#include <string_view>

#include "platform/DeviceInfo.h"

namespace sable {

/// "ProductType; ProductName BuildVersion" of this device.
std::string deviceString(const platform::DeviceInfo& deviceInfo);

/// The user agent under which a product asks the service: "Sabled/1.0 (DEVICE) PRODUCT". A product
/// that already has that form stays as it is, so composing twice never nests; an empty product
/// gives "".
std::string composeUserAgent(std::string_view product, const platform::DeviceInfo& deviceInfo);

/// The daemon's own user agent. Its name stands before the parenthesis and after it: the service
/// knows it in this form.
std::string sabledUserAgent(const platform::DeviceInfo& deviceInfo);

}  // namespace sable
