#pragma once

#include <atomic>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/FileManager.h"
#include "platform/HTTPBackgroundSession.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"
#include "sabled/DownloadResource.h"

namespace sable {

class Assembly;

/// Posted on the manager's queue when a resource's file is in its place: "identifier" (std::string) and
/// "url" (std::filesystem::path), the file. Observers must not wait for the manager.
inline constexpr std::string_view kSBLFileDownloadCompletedNotification =
    "SBLFileDownloadCompletedNotification";
/// Posted likewise when a resource's file is gone: "identifier".
inline constexpr std::string_view kSBLFileDeletedNotification = "SBLFileDeletedNotification";

/// Keeps the files that the bag lists on the device: downloads each in the background when it is new,
/// changed or missing, and remembers over restarts which version it holds. Any thread.
///
///     unknown --bag lists it--> in the table --new, changed, missing, or hints for lookups-->
///        ^                       |   ^    delayed --60 s--> in flight --200--> file replaced
///        |                       |   '--- any end: the next bag decides anew -----'
///        '-- bag drops it (with its file); hints: the device has moved (the file stays)
///
/// A bag takes back every download that the one before it asked for: there is one generation at a time.
class DownloadManager final : public platform::HTTPBackgroundSessionDelegate {
 public:
  explicit DownloadManager(Assembly& assembly);
  ~DownloadManager() override;

  /// Version by identifier, of the resources that have one.
  std::map<std::string, std::string> resourceVersions();
  std::optional<DownloadResource> resourceForKey(const std::string& identifier);
  /// The file as it is now, open, and its attributes. Errors: of kPOSIXErrorDomain, from the disk; of
  /// kSBLErrorDomain, for what is no resource's name. Waits for the disk only, so observers may call it.
  Expected<std::unique_ptr<platform::ReadableFile>> fileHandleForResource(
      const std::string& identifier, platform::FileAttributes& attributes);
  /// Forgets which hints for lookups there are, so that the next bag fetches those of the new place.
  void _handleSignificantLocationChange();

  /// What the table holds and what is planned, for people, on a queue of its own choice:
  /// docs/relay.md lists the members.
  void describeResources(platform::Function<void(Dictionary)> completion);

  void didFinishDownloadingToURL(const platform::HTTPBackgroundTask& task,
                                 const std::filesystem::path& location) override;
  void didCompleteWithError(const platform::HTTPBackgroundTask& task,
                            const std::optional<Error>& error) override;

 private:
  using Tasks = std::vector<platform::HTTPBackgroundTask>;

  /// A download that waits for its delay to pass.
  struct Delayed {
    platform::MonotonicTime due;
    std::string reason;
    platform::Timer timer;
  };

  void bagChangeNotification(const platform::Notification& notification);
  void _start();
  void reportError(std::string reason);
  void reportDownloadError(const Error& error);
  static bool _isLookupResource(std::string_view identifier);
  static std::string identifierOf(const platform::HTTPBackgroundTask& task);

  // On queue_.
  void _loadResources();
  void _saveResources();
  void _downloadBagResources(const std::shared_ptr<const Dictionary>& rawBag);
  void addBagResources(const Dictionary& rawBag);
  bool _resourceDownloadAllowed(std::string_view identifier) const;
  void _addResource(const std::string& identifier, const std::optional<std::string>& url);
  const char* reasonForDownload(const DownloadResource& resource, const std::string& url);
  void _downloadResource(const std::string& identifier, const std::string& url, const std::string& reason);
  platform::HTTPRequest _createDownloadRequest(const std::string& identifier, const std::string& url);
  std::string _resourceVersion(const std::string& identifier) const;
  void _deleteResource(const std::string& identifier, bool removeFile);
  void removeFileOf(const std::string& identifier);
  void noteCompletion(const platform::HTTPBackgroundTask& task);
  void storeFile(const platform::HTTPBackgroundTask& task, const std::filesystem::path& location);
  Dictionary description(const Tasks& tasks) const;
  Dictionary description(const DownloadResource& resource, const Tasks& tasks) const;

  // Any thread.
  std::optional<std::filesystem::path> cacheDirectory() const;
  std::optional<std::filesystem::path> _pathToResource(std::string_view identifier) const;

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  std::atomic<bool> hasStarted_{false};

  // On queue_.
  std::map<std::string, DownloadResource> resources_;
  std::map<std::string, Delayed> delayed_;
  unsigned generation_ = 0;  ///< counts bags

  std::vector<platform::NotificationCenter::Token> observations_;
};

}  // namespace sable
