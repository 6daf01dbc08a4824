#include "sabled/ClientNames.h"

#include <fmt/core.h>

#include <algorithm>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"

namespace sable {

std::string lowercasedASCII(std::string_view text) {
  std::string result(text);
  std::ranges::transform(result, result.begin(),
                         [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; });
  return result;
}

std::optional<std::string_view> extractClientNameFromString(std::string_view text) {
  const std::string lower = lowercasedASCII(text);
  for (const std::string_view name : kSBLClientNames) {
    if (lower.find(name) != std::string::npos) return name;
  }
  return std::nullopt;
}

std::string_view getClientFromUserAgent(const std::optional<std::string>& userAgent) {
  if (!userAgent) return "unknown";
  const std::string lower = lowercasedASCII(*userAgent);
  if (lower.find("rover") != std::string::npos) return "rover";
  if (lower.find("beacon") != std::string::npos) return "beacon";
  return "unknown";
}

std::string createTallyKey(std::string_view first, std::string_view second) {
  return fmt::format("{}.{}.{}", kSBLSubsystem, first, second);
}

}  // namespace sable
