#include "sabled/DownloadResource.h"

#include <algorithm>
#include <map>
#include <vector>

#include "platform/URL.h"

namespace sable {
namespace {

constexpr std::size_t kMaximumNameBytes = 255;  // what file systems take

bool isControl(char c) {
  return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
}

/// The daemon's own files and folders beside the resources.
bool isTaken(std::string_view name) {
  return name == "bag.plist" || name == "http" || name == "temporary" || name.starts_with("session.") ||
         name.starts_with("flushing.") || name.starts_with("crowdsourcing.");
}

}  // namespace

bool isResourceIdentifier(std::string_view identifier) {
  // What begins with a dot is where files are prepared before they get their names.
  return !identifier.empty() && identifier.size() <= kMaximumNameBytes && identifier.front() != '.' &&
         identifier.find('/') == std::string_view::npos && std::ranges::none_of(identifier, isControl) &&
         !isTaken(identifier);
}

std::optional<std::string> urlForCompare(std::string_view text) {
  auto url = platform::URL::parse(text.substr(0, text.find('#')));
  if (!url) return std::nullopt;
  std::map<std::string, platform::URLQueryItem> byName;
  for (platform::URLQueryItem& item : url->queryItems()) {
    std::string name = item.name;
    byName.insert_or_assign(std::move(name), std::move(item));
  }
  byName.erase("key");
  std::vector<platform::URLQueryItem> items;
  items.reserve(byName.size());
  for (auto& [name, item] : byName) items.push_back(std::move(item));
  url->setQueryItems(items);
  return url->string();
}

std::string versionFromURL(std::string_view text) {
  const auto url = platform::URL::parse(text);
  if (!url) return {};
  const auto items = url->queryItems();
  const auto version = std::ranges::find(items, "version", &platform::URLQueryItem::name);
  return version == items.end() ? std::string() : version->value.value_or("");
}

}  // namespace sable
