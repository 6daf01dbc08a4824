#include "Bag.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>

namespace service {

namespace {

constexpr std::array kSections = {"noun", "verb", "adjective", "adverb", "package"};

Json builtIn(const std::string& base) {
  Json bag = {
      {"version", "1"},
      {"enabled", true},
      {"feedback_enabled", true},
      {"search_url", base + "/search"},
      {"warm_url", base + "/warm"},
      {"feedback_url", base + "/feedback"},
      {"crowdsourcing_url", base + "/crowdsourcing"},
      {"minimum_query_length", 1},
      {"request_timeout", 15},
      {"search_render_timeout", 2},
      {"send_geo_environment_header", true},
      {"geo_location_sources", {"gps", "wifi", "cell"}},
      {"bramble", {{"proxy", base}, {"enabled", false}}},
      {"image_urls", Json::object()},
      {"subscription_provider_domains", {"video.example"}},
      {"subscription_provider_bundle_identifiers", {"com.example.video"}},
      {"subscription_ttl", 86400},
      {"download_resources_list", Json::array()},
  };
  for (const auto* section : kSections) {
    bag["image_urls"][fmt::format("section.{}", section)] =
        fmt::format("{}/images/section-{}.png", base, section);
  }
  return bag;
}

}  // namespace

Bag::Bag(std::string base) : base_(std::move(base)), keys_(builtIn(base_)) {
  for (const auto& [identifier, resource] : resources_.all()) list(identifier);
}

void Bag::list(const std::string& identifier) {
  Json& listed = keys_["download_resources_list"];
  if (!listed.is_array()) listed = Json::array();
  if (std::find(listed.begin(), listed.end(), Json(identifier)) == listed.end()) listed.push_back(identifier);
  keys_[identifier] = base_ + resources_.path(identifier);
}

void Bag::merge(const Json& keys) {
  const std::lock_guard lock(mutex_);
  keys_.merge_patch(keys);
}

void Bag::setResource(const std::string& identifier, std::string content) {
  const std::lock_guard lock(mutex_);
  resources_.set(identifier, std::move(content));
  list(identifier);
}

Answer Bag::answer(const Request& request, const std::optional<std::string>& version) {
  Json keys;
  {
    const std::lock_guard lock(mutex_);
    keys = keys_;
  }
  if (version) keys["version"] = *version;
  return Answer::tagged(request, "application/json", toText(keys), "private, no-cache");
}

Answer Bag::resourceAnswer(const Request& request) {
  const std::lock_guard lock(mutex_);
  return resources_.answer(request);
}

}  // namespace service
