#pragma once

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Runtime.h"

namespace sable {

class Assembly;
class FileContainer;

/// The session files: "com.kestrel.sabled/session.N" in the user's caches directory, 0600, N counting
/// up. A file is written by one session, then waits for the flusher; so do files that an earlier run
/// left, unless they are too old. Limits are the settings "SBLSessionSizeLimit" (bytes) and
/// "SBLSessionMaxAge" (seconds) as they are at the start. Any thread.
///
///     session.N --complete--> available --hold--> flushing.UUID --sent, unreadable, nowhere to send-->
///     deleted
///                                 ^                    |
///                                 '--- could not begin, or killed before the upload was accepted
///
/// The UUID goes with the upload, so that the next run can ask whether that was accepted: a kill at any
/// moment neither loses a session nor sends it twice. Crowdsourcing sessions, which go elsewhere, wait
/// in files "crowdsourcing.UUID".
class SablePersistentStorage {
 public:
  /// Looks for the files of earlier runs; waits for the disk.
  explicit SablePersistentStorage(Assembly& assembly);

  /// A new file, open for writing; null when there can be none, which is logged. Waits for the disk
  /// as long as making a file takes.
  std::shared_ptr<FileContainer> createFileContainerForWriting();
  /// The same for what goes to the crowdsourcing address, which the file's name tells from the start.
  std::shared_ptr<FileContainer> createCrowdsourcingFileContainerForWriting();

  /// Closes the file, after what was written before, and makes it available. Does not wait.
  void closeSessionWithFileContainer(std::shared_ptr<FileContainer> container);

  /// The same for a crowdsourcing session.
  void closeCrowdsourcingSessionWithFileContainer(std::shared_ptr<FileContainer> container);

  /// The files whose sessions are complete.
  std::vector<std::shared_ptr<FileContainer>> getAvailableSessionHandles();
  std::vector<std::shared_ptr<FileContainer>> getAvailableCrowdsourcingHandles();

  /// Takes the file out of the available ones until it is deleted or released, and gives it a token(). False
  /// when the disk does not let it: it stays available. What is no file of ours any more gets no token.
  bool holdSessionWithFileContainer(const std::shared_ptr<FileContainer>& container);
  /// Makes a file that was held available again.
  void releaseSessionWithFileContainer(const std::shared_ptr<FileContainer>& container);

  /// Deletes the file. It is gone when this returns.
  void deleteSessionWithFileContainer(const std::shared_ptr<FileContainer>& container);

  /// What earlier runs held is deleted where `hasAccepted` says so of its token, else available again.
  void adoptHeldSessions(const std::function<bool(const std::string&)>& hasAccepted);

 private:
  using FileContainers = std::vector<std::shared_ptr<FileContainer>>;

  std::optional<std::filesystem::path> _newFileUrl(const std::function<std::string()>& nextName);
  std::shared_ptr<FileContainer> containerIn(const std::optional<std::filesystem::path>& fileUrl);
  FileContainers& listOf(const FileContainer& container);
  FileContainers available(const FileContainers& list);
  void _scanCacheDirectory();
  void scanFile(const std::string& name);
  void scanHeldFile(const std::string& name);
  std::shared_ptr<FileContainer> foundFile(const std::filesystem::path& fileUrl);
  bool deleteIfTooOld(const std::filesystem::path& fileUrl, platform::WallTime creationDate);
  void settleLedger();
  void _deleteSessionFile(FileContainer& container);

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::optional<std::filesystem::path> cachesUrl_;
  const std::string version_;
  const std::uint64_t maxFileSize_;
  const platform::Duration maxFileAge_;

  /// Of the next name. After the last number it begins again; names that are taken are passed over.
  std::atomic<std::uint32_t> handleId_{0};

  // On queue_.
  FileContainers fileContainers_, crowdsourcingContainers_;
  FileContainers heldByEarlierRuns_;  ///< until they are adopted
};

}  // namespace sable
