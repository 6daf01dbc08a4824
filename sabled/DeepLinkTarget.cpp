#include "sabled/DeepLinkTarget.h"

#include <algorithm>
#include <array>
#include <string_view>

namespace sable {
namespace {

constexpr std::size_t kMaximumBundleIdentifier = 155, kMaximumURL = 2048, kMaximumScheme = 64;
constexpr std::size_t kMaximumHost = 253, kMaximumLabel = 63;  // RFC 1035, section 2.3.4

/// Schemes that name what is on the device, a person or a program, and are no application's own.
constexpr std::array<std::string_view, 16> kCommonSchemes{
    "about", "blob", "data",   "facetime", "file", "ftp", "geo", "intent",
    "irc",   "jar",  "mailto", "sip",      "sms",  "tel", "ws",  "wss"};

/// Ends of names that lead nowhere in public.
constexpr std::array<std::string_view, 11> kSpecialNames{
    "alt", "arpa", "corp", "home", "internal", "invalid", "lan", "local", "mail", "localhost", "onion"};

constexpr bool isLetter(char c) {
  return c >= 'a' && c <= 'z';
}
constexpr bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

std::string lowercased(std::string_view text) {
  std::string lower(text);
  std::ranges::transform(lower, lower.begin(),
                         [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; });
  return lower;
}

bool isBundleIdentifier(std::string_view text) {
  return !text.empty() && text.size() <= kMaximumBundleIdentifier && std::ranges::all_of(text, [](char c) {
    return isLetter(c) || (c >= 'A' && c <= 'Z') || isDigit(c) || c == '.' || c == '-' || c == '_';
  });
}

/// RFC 3986, section 3.1, in lower case.
bool isScheme(std::string_view text) {
  return !text.empty() && text.size() <= kMaximumScheme && isLetter(text.front()) &&
         std::ranges::all_of(
             text, [](char c) { return isLetter(c) || isDigit(c) || c == '+' || c == '-' || c == '.'; });
}

bool isLabel(std::string_view text) {
  return !text.empty() && text.size() <= kMaximumLabel && text.front() != '-' && text.back() != '-' &&
         std::ranges::all_of(text, [](char c) { return isLetter(c) || isDigit(c) || c == '-'; });
}

bool isPublicHost(std::string_view host) {
  const auto dot = host.rfind('.');
  if (dot == std::string_view::npos || host.size() > kMaximumHost) return false;
  const std::string_view last = host.substr(dot + 1);
  // The last label of a name begins with a letter; that of an address does not.
  if (last.empty() || !isLetter(last.front()) || std::ranges::count(kSpecialNames, last) > 0) return false;
  for (std::string_view rest = host; !rest.empty();) {
    const std::string_view label = rest.substr(0, rest.find('.'));
    if (!isLabel(label)) return false;
    rest.remove_prefix(std::min(rest.size(), label.size() + 1));
  }
  return true;
}

}  // namespace

std::optional<std::string> deepLinkTarget(const platform::DeepLink& link) {
  const std::string_view url = link.url;
  const auto colon = url.find(':');
  if (colon == std::string_view::npos || url.size() > kMaximumURL) return std::nullopt;
  const std::string scheme = lowercased(url.substr(0, colon));
  if (!isScheme(scheme) || !isBundleIdentifier(link.bundleIdentifier)) return std::nullopt;

  const std::string_view rest = url.substr(colon + 1);
  const bool hasAuthority = rest.starts_with("//");
  const std::string host =
      lowercased(hasAuthority ? rest.substr(2, rest.substr(2).find_first_of("/?#")) : "");
  if (scheme == "http" || scheme == "https") {
    return isPublicHost(host) ? std::optional(link.bundleIdentifier + " " + host) : std::nullopt;
  }
  const bool hasUserInformationOrPort = host.find_first_of("@:") != std::string::npos;
  if (hasUserInformationOrPort || std::ranges::count(kCommonSchemes, scheme) > 0) return std::nullopt;
  return link.bundleIdentifier + " " + scheme + ":";
}

}  // namespace sable
