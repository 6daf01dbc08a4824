#include "SableKit/SBLBag.h"

#include <fmt/core.h>

#include <algorithm>
#include <cctype>
#include <cmath>
#include <nlohmann/json.hpp>

#include "platform/URL.h"

namespace sable {
namespace {

std::string lowercased(std::string_view text) {
  std::string result(text);
  std::ranges::transform(result, result.begin(), [](unsigned char c) { return std::tolower(c); });
  return result;
}

const Dictionary* find(const Dictionary& object, std::string_view key) {
  if (!object.is_object()) return nullptr;
  const auto found = object.find(key);
  return found == object.end() ? nullptr : &*found;
}

const Dictionary* findOverride(const Dictionary& bag, std::string_view userAgent) {
  const std::string agent = lowercased(userAgent);
  const Dictionary* agents = find(bag, "agents");
  if (agents == nullptr) return nullptr;
  for (const std::string_view name : kSBLClientNames) {
    if (agent.find(name) != std::string::npos) return find(*agents, name);
  }
  return nullptr;
}

/// Durations and lengths: a JSON number that is finite and not negative.
std::optional<double> nonNegative(const Dictionary& value) {
  if (!value.is_number()) return std::nullopt;
  const double number = value.get<double>();
  return std::isfinite(number) && number >= 0 ? std::optional(number) : std::nullopt;
}

SBLBag::Strings strings(const Dictionary& value) {
  if (!value.is_array()) return std::nullopt;
  std::vector<std::string> result;
  for (const Dictionary& item : value) {
    if (item.is_string()) result.push_back(item.get<std::string>());
  }
  return result;
}

}  // namespace

SBLBag::SBLBag(std::shared_ptr<const Dictionary> dictionary, std::string userAgent)
    : rawBag_(std::move(dictionary)),
      userAgent_(std::move(userAgent)),
      override_(findOverride(*rawBag_, userAgent_)),
      version_(readVersion()),
      isEnabled_(read("enabled", false)),
      feedbackEnabled_(read("feedback_enabled", false)),
      searchURL_(readURL("search_url")),
      warmURL_(readURL("warm_url")),
      feedbackURL_(readURL("feedback_url")),
      crowdsourcingURL_(readURL("crowdsourcing_url")),
      minimumQueryLength_(static_cast<std::uint64_t>(std::min(read("minimum_query_length", 1.0), 1e9))),
      timeoutIntervalForRequest_(read("request_timeout", 15.0)),
      searchRenderTimeout_(read("search_render_timeout", 2.0)),
      sendGeoEnvironmentHeader_(read("send_geo_environment_header", false)),
      supportedGeoLocationSources_(readSet("geo_location_sources")),
      subscriptionTTL_(read("subscription_ttl", 0.0)),
      domainWhitelist_(readStrings("subscription_provider_domains")),
      bundleIdentifierWhitelist_(readStrings("subscription_provider_bundle_identifiers")) {
  if (const Dictionary* bramble = value("bramble"); bramble != nullptr && !bramble->is_object()) {
    reportWrongType("bramble", "an object");
  }
}

const Dictionary* SBLBag::value(std::string_view key) const {
  if (override_ != nullptr) {
    if (const Dictionary* found = find(*override_, key)) return found;
  }
  return find(*rawBag_, key);
}

void SBLBag::reportWrongType(std::string_view key, std::string_view wanted) {
  problems_.push_back(fmt::format("bag key {} is not {}, ignored", key, wanted));
}

template <class T>
T SBLBag::read(std::string_view key, T absent) {
  const Dictionary* found = value(key);
  if (found == nullptr) return absent;
  if constexpr (std::is_same_v<T, bool>) {
    if (found->is_boolean()) return found->get<bool>();
    reportWrongType(key, "a boolean");
  } else {
    if (const auto number = nonNegative(*found)) return *number;
    reportWrongType(key, "a number of 0 or more");
  }
  return absent;
}

std::string SBLBag::readVersion() {
  const Dictionary* found = value("version");
  if (found == nullptr) return {};
  if (found->is_string()) return found->get<std::string>();
  if (found->is_number()) return found->dump();
  reportWrongType("version", "a string or a number");
  return {};
}

std::optional<std::string> SBLBag::readURL(std::string_view key) {
  const Dictionary* found = value(key);
  if (found == nullptr) return std::nullopt;
  if (found->is_string() && platform::URL::parse(found->get_ref<const std::string&>())) {
    return found->get<std::string>();
  }
  reportWrongType(key, "a URL");
  return std::nullopt;
}

SBLBag::Strings SBLBag::readStrings(std::string_view key) {
  const Dictionary* found = value(key);
  if (found == nullptr) return std::nullopt;
  auto items = strings(*found);
  if (!items) reportWrongType(key, "an array");
  return items;
}

std::set<std::string> SBLBag::readSet(std::string_view key) {
  const auto items = readStrings(key).value_or(std::vector<std::string>());
  return {items.begin(), items.end()};
}

Dictionary SBLBag::brambleConfiguration() const {
  const Dictionary* found = value("bramble");
  return found != nullptr && found->is_object() ? *found : Dictionary(nullptr);
}

std::optional<std::string> SBLBag::urlForIdentifier(std::string_view identifier) const {
  const Dictionary* urls = value("image_urls");
  return urls == nullptr ? std::nullopt : stringMember(*urls, identifier);
}

}  // namespace sable
