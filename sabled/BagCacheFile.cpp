#include "sabled/BagCacheFile.h"

#include <cerrno>
#include <nlohmann/json.hpp>

#include "SableKit/SBLConstants.h"
#include "platform/PropertyList.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

/// More than any bag that was accepted can take.
constexpr std::size_t kMaximumFileBytes = 8u << 20;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryBag);
}

}  // namespace

Expected<std::filesystem::path> BagCacheFile::path() const {
  auto caches = fileManager_.cachesDirectory();
  if (!caches) {
    log().error("error getting cache directory {}", caches.error().description());
    return caches;
  }
  const std::filesystem::path directory = *caches / kSBLSubsystem;
  if (const auto created = fileManager_.createDirectory(directory); !created) {
    log().error("error creating agent-specific cache directory {}", created.error().description());
    return tl::unexpected(created.error());
  }
  return directory / "bag.plist";
}

std::shared_ptr<const Dictionary> BagCacheFile::read() const {
  const auto file = path();
  if (!file) return nullptr;
  const auto bytes = fileManager_.read(*file, kMaximumFileBytes);
  if (!bytes) {
    if (bytes.error().code != ENOENT)
      log().error("Error reading from bag cache: {}.", bytes.error().description());
    return nullptr;
  }
  auto dictionary = platform::decodePropertyList(*bytes);
  if (!dictionary) {
    log().error("Error reading from bag cache: {}.", dictionary.error().description());
    return nullptr;
  }
  if (!dictionary->is_object()) {
    log().error("Unexpected class deserialized from bag cache: {}.", dictionary->type_name());
    return nullptr;
  }
  return std::make_shared<const Dictionary>(std::move(*dictionary));
}

void BagCacheFile::write(const Dictionary& dictionary) const {
  const auto file = path();
  if (!file) {
    // Two blanks after the first full stop: log readers match this line.
    log().error("Couldn't get path to cache bag.  Error: {}.", file.error().description());
    return;
  }
  const auto bytes = platform::encodePropertyList(dictionary);
  if (!bytes) {
    log().error("Error writing bag to persistent cache: {}.", bytes.error().description());
    return;
  }
  if (const auto written = fileManager_.writeAtomically(*file, *bytes); !written) {
    log().error("Could not write to {}", file->string());
    log().error("{}", written.error().description());
  }
}

}  // namespace sable
