#pragma once

#include <cstddef>
#include <filesystem>
#include <string>
#include <vector>

namespace sable::platform {

class FileManager;
class Runtime;

/// A link into an application's content, which the application calls fit for public indexing. Untrusted
/// text.
struct DeepLink {
  std::string bundleIdentifier;
  std::string url;
};

/// A folder into which applications drop deep links, a file each: a JSON object with the strings
/// `bundle_id` and `url` and with `eligible_for_public_indexing` true. An application writes a file
/// under a name that begins with a dot and renames it when it is complete. Names of files are as private
/// as what they hold, and so are error texts that quote them: neither is told or logged.
class DeepLinkSpool {
 public:
  static constexpr std::size_t kMaximumBytes = 4096;  ///< of a file

  DeepLinkSpool(FileManager& fileManager, const Runtime& clock, std::filesystem::path folder);

  struct Content {
    std::vector<DeepLink> links;
    std::size_t refused = 0;  ///< no link of today or the day before, or not this user's plain file
    std::size_t unread = 0;   ///< beyond the maximum
    std::size_t stuck = 0;    ///< cannot be deleted: a folder, or a disk that fails
  };

  /// Empties the folder and answers with what it held, by the first `maximumFiles` names in order; what
  /// cannot be deleted is not in the answer. Every file is deleted, whatever it is, and of a link only
  /// itself; files whose names begin with a dot, only when they are a day old. May block on the disk.
  Content take(std::size_t maximumFiles);

 private:
  bool isBeingWritten(const std::filesystem::path& path) const;
  std::string readPlainFile(const std::filesystem::path& path) const;

  FileManager& fileManager_;
  const Runtime& clock_;
  const std::filesystem::path folder_;
};

}  // namespace sable::platform
