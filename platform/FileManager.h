#pragma once

#include <cstddef>
#include <filesystem>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace sable::platform {

/// Files of the daemon. Errors are of kPOSIXErrorDomain. May block on the disk. Any thread.
class FileManager {
 public:
  virtual ~FileManager() = default;

  /// The user's caches directory, created (0700) when missing.
  virtual Expected<std::filesystem::path> cachesDirectory() = 0;

  /// Creates a directory (0700) and its parents when missing.
  virtual Expected<void> createDirectory(const std::filesystem::path& path) = 0;

  /// Reads a regular file whole; EFBIG when it is longer than `maximumBytes`. Never follows a
  /// symbolic link, never waits on a FIFO.
  virtual Expected<std::string> read(const std::filesystem::path& path, std::size_t maximumBytes) = 0;

  /// Replaces the file whole, with permissions 0600: readers see the old bytes or the new ones,
  /// also after a power cut, never a mixture.
  virtual Expected<void> writeAtomically(const std::filesystem::path& path, std::string_view bytes) = 0;

  virtual Expected<void> remove(const std::filesystem::path& path) = 0;
};

}  // namespace sable::platform
