#pragma once

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Runtime.h"

namespace sable {

class Assembly;
class FileContainer;

/// The session files: "com.kestrel.sabled/session.N" in the user's caches directory, 0600, N counting
/// up. A file is written by one session, then waits until the flusher has read and deleted it; so do
/// files that an earlier run left, unless they are too old. Limits are the settings
/// "SBLSessionSizeLimit" (bytes) and "SBLSessionMaxAge" (seconds) as they are at the start. Any
/// thread.
class SablePersistentStorage {
 public:
  /// Looks for the files of earlier runs; waits for the disk.
  explicit SablePersistentStorage(Assembly& assembly);

  /// A new file, open for writing; null when there can be none, which is logged. Waits for the disk
  /// as long as making a file takes.
  std::shared_ptr<FileContainer> createFileContainerForWriting();

  /// Closes the file, after what was written before, and makes it available. Does not wait.
  void closeSessionWithFileContainer(std::shared_ptr<FileContainer> container);

  /// The files whose sessions are complete.
  std::vector<std::shared_ptr<FileContainer>> getAvailableSessionHandles();

  /// Deletes the file. It is gone when this returns, so that what is sent now is never sent again.
  void deleteSessionWithFileContainer(const std::shared_ptr<FileContainer>& container);

 private:
  std::optional<std::filesystem::path> _newFileUrl();
  void _scanCacheDirectory();
  void scanFile(const std::string& name);
  bool deleteIfTooOld(const std::filesystem::path& fileUrl, platform::WallTime creationDate);
  void settleLedger();
  void _deleteSessionFile(const FileContainer& container);

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::optional<std::filesystem::path> cachesUrl_;
  const std::string version_;
  const std::uint64_t maxFileSize_;
  const platform::Duration maxFileAge_;

  /// Of the next name. After the last number it begins again; names that are taken are passed over.
  std::atomic<std::uint32_t> handleId_{0};

  std::vector<std::shared_ptr<FileContainer>> fileContainers_;  ///< on queue_
};

}  // namespace sable
