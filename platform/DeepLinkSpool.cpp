#include "platform/DeepLinkSpool.h"

#include <nlohmann/json.hpp>
#include <optional>

#include "platform/Dictionary.h"
#include "platform/FileManager.h"

namespace sable::platform {
namespace {

/// How old a link may be: the folder is emptied every day.
constexpr Duration kMaximumAge = std::chrono::hours(48);
/// How long an application may take to write a file.
constexpr Duration kMaximumWriting = std::chrono::hours(24);

std::optional<DeepLink> linkFrom(std::string_view text) {
  const auto object = parseJSON(text, DeepLinkSpool::kMaximumBytes);
  if (!object || !booleanMember(*object, "eligible_for_public_indexing").value_or(false)) return std::nullopt;
  auto bundleIdentifier = stringMember(*object, "bundle_id"), url = stringMember(*object, "url");
  if (!bundleIdentifier || !url) return std::nullopt;
  return DeepLink{*std::move(bundleIdentifier), *std::move(url)};
}

}  // namespace

DeepLinkSpool::DeepLinkSpool(FileManager& fileManager, const Runtime& clock, std::filesystem::path folder)
    : fileManager_(fileManager), clock_(clock), folder_(std::move(folder)) {}

bool DeepLinkSpool::isBeingWritten(const std::filesystem::path& path) const {
  if (!path.filename().native().starts_with('.')) return false;
  const auto attributes = fileManager_.attributes(path);
  return attributes && clock_.now() - attributes->creationDate < kMaximumWriting;
}

/// Empty for what is none.
std::string DeepLinkSpool::readPlainFile(const std::filesystem::path& path) const {
  const auto attributes = fileManager_.attributes(path);
  if (!attributes || !attributes->isOwn || clock_.now() - attributes->creationDate > kMaximumAge) return {};
  return fileManager_.read(path, kMaximumBytes).value_or("");
}

DeepLinkSpool::Content DeepLinkSpool::take(std::size_t maximumFiles) {
  Content content;
  std::size_t files = 0;
  const auto names = fileManager_.list(folder_);
  if (!names) return content;
  for (const std::string& name : *names) {
    const auto path = folder_ / name;
    if (isBeingWritten(path)) continue;
    const bool wanted = files++ < maximumFiles;
    const std::string text = wanted ? readPlainFile(path) : std::string();
    if (!fileManager_.remove(path)) {
      ++content.stuck;
    } else if (!wanted) {
      ++content.unread;
    } else if (auto link = linkFrom(text)) {
      content.links.push_back(*std::move(link));
    } else {
      ++content.refused;
    }
  }
  return content;
}

}  // namespace sable::platform
