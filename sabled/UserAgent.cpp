#include "sabled/UserAgent.h"

#include <fmt/core.h>

#include "SableKit/SBLConstants.h"

namespace sable {

std::string deviceString(const platform::DeviceInfo& deviceInfo) {
  return fmt::format("{}; {} {}", deviceInfo.answer("ProductType"), deviceInfo.answer("ProductName"),
                     deviceInfo.answer("BuildVersion"));
}

std::string composeUserAgent(std::string_view product, const platform::DeviceInfo& deviceInfo) {
  if (product.empty()) return {};
  if (product.find(fmt::format("{} (", kSBLSabledNameVersion)) != std::string_view::npos)
    return std::string(product);
  return fmt::format("{} ({}) {}", kSBLSabledNameVersion, deviceString(deviceInfo), product);
}

std::string sabledUserAgent(const platform::DeviceInfo& deviceInfo) {
  return composeUserAgent(kSBLSabledNameVersion, deviceInfo);
}

}  // namespace sable
