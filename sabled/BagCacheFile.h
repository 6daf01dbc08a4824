#pragma once

#include <filesystem>
#include <memory>
#include <optional>

#include "platform/Dictionary.h"
#include "platform/FileManager.h"

namespace sable {

/// The bag's mirror on disk: the binary property list "com.kestrel.sabled/bag.plist" in the user's
/// caches directory, 0600, replaced whole. Both operations block on the disk; failures are logged
/// and cost nothing but the copy.
class BagCacheFile {
 public:
  explicit BagCacheFile(platform::FileManager& fileManager) : fileManager_(fileManager) {}

  /// The dictionary in the file; null when there is none or it cannot be used. A missing file is
  /// no news.
  std::shared_ptr<const Dictionary> read() const;
  void write(const Dictionary& dictionary) const;

 private:
  Expected<std::filesystem::path> path() const;

  platform::FileManager& fileManager_;
};

}  // namespace sable
