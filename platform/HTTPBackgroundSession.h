#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/HTTPSession.h"
#include "platform/Runtime.h"

namespace sable::platform {

enum class HTTPBackgroundTaskKind { upload, download };

/// A background transfer as its session knows it at one moment.
struct HTTPBackgroundTask {
  std::int64_t identifier = 0;  ///< unique within the session, after a restart too
  HTTPBackgroundTaskKind kind = HTTPBackgroundTaskKind::upload;
  HTTPRequest originalRequest;  ///< as first issued, without its body
  std::string currentURL;       ///< after redirects
  std::string description;      ///< the owner's note, as given
  std::optional<HTTPResponse> response;
};

/// Whoever hears of a background session's transfers. Called on the session's callbackQueue().
class HTTPBackgroundSessionDelegate {
 public:
  virtual ~HTTPBackgroundSessionDelegate() = default;

  /// `expected` is -1 where the length is not known.
  virtual void didSendBodyData(const HTTPBackgroundTask& /*task*/, std::int64_t /*sent*/,
                               std::int64_t /*expected*/) {}
  /// A response with its whole body in a file, of whatever status; didCompleteWithError follows. The
  /// file is the delegate's to move away until this returns.
  virtual void didFinishDownloadingToURL(const HTTPBackgroundTask& /*task*/,
                                         const std::filesystem::path& /*location*/) {}
  /// The task has ended: exactly once for each accepted task, also when the process was killed
  /// meanwhile; `error` is set when it ended without a whole response.
  virtual void didCompleteWithError(const HTTPBackgroundTask& task, const std::optional<Error>& error) = 0;
  virtual void didBecomeInvalidWithError(const std::optional<Error>& /*error*/) {}
  /// Nothing is left to run, after at least one task has ended.
  virtual void didFinishEventsForBackgroundURLSession() {}
};

struct HTTPBackgroundSessionConfiguration {
  std::string identifier;      ///< names the session's tasks on disk
  bool discretionary = false;  ///< wait while the device is on battery, or the network is metered
  bool allowsExpensiveNetworkAccess = true;            ///< run while the network is metered
  Duration requestTimeout = std::chrono::seconds(60);  ///< of one attempt, without a byte of progress
  Duration resourceTimeout =
      std::chrono::hours(7 * 24);  ///< of a task from its acceptance to its last attempt
  std::size_t maximumDownloadBytes = 64u << 20;
};

/// Transfers that outlive the process. An accepted task is on disk before the call returns, is tried
/// again after transport errors and a 503 or 429 with Retry-After (platform/TransferRetry.h), until
/// another response has arrived whole or its resource time-out is over, and is resumed by the next
/// process that makes the session. Any thread; the calls that accept a task wait for the disk.
///
///     accepted --resume--> waiting --due, and allowed--> running --whole response, hopeless error--> ended
///                            ^                              |                                          |
///                            '---- pause: error, "later" ---'                            delegate called,
///                            noted
///
/// Where the process is killed, whatever runs is waiting in the next one: a body that the service has
/// taken while we died is sent once more. Where it is killed after the delegate has been called and
/// before that is noted, some milliseconds, the delegate hears of the end once more.
class HTTPBackgroundSession {
 public:
  virtual ~HTTPBackgroundSession() = default;

  /// Accepts an upload of the file as it is now; the session takes its own copy, the file may be
  /// removed at once. `description` comes back with the task. A `token` that is not empty marks the
  /// work this upload stands for, see hasAccepted(). Begins with resume(), or with the next process.
  /// An invalid request, a body that cannot be read and a disk that is full are errors of this call.
  virtual Expected<std::int64_t> uploadTask(const HTTPRequest& request, const std::filesystem::path& body,
                                            std::string description, std::string_view token) = 0;
  /// Accepts a download, to be run within `window` when the device has time for it: a discretionary
  /// session's waits no longer than that for external power.
  virtual Expected<std::int64_t> downloadTask(const HTTPRequest& request, std::string description,
                                              Duration window) = 0;
  /// Whether an upload with this token was ever accepted: running, waiting, or ended within the
  /// resource time-out. Whoever was killed before it could note that, asks here and does not send twice.
  virtual bool hasAccepted(std::string_view token) = 0;

  virtual void resume(std::int64_t identifier) = 0;
  /// Ends it with HTTPErrorCode::cancelled unless it has ended already.
  virtual void cancel(std::int64_t identifier) = 0;
  /// The tasks that have not ended, on callbackQueue(): nobody may wait for them whom a delegate's call
  /// waits for.
  virtual void getAllTasks(Function<void(std::vector<HTTPBackgroundTask>)> completion) = 0;

  virtual SerialQueue& callbackQueue() = 0;
};

}  // namespace sable::platform
