#pragma once

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/HTTPBackgroundSession.h"

namespace sable::platform {

class NotificationCenter;

/// Posted when the device's network becomes metered or stops being so.
inline constexpr std::string_view kNetworkCostDidChangeNotification = "NetworkCostDidChange";

/// How often a transfer that waits for better conditions looks for them where the host does not tell.
inline constexpr Duration kConditionsLook = std::chrono::minutes(15);

/// A background transfer as it is kept.
struct BackgroundTransfer {
  HTTPBackgroundTask task;
  WallTime accepted{};
  Duration window{};       ///< of a download; 0 without
  int attempts = 0;        ///< that were begun
  WallTime lastAttempt{};  ///< when one last ended
  Duration pause{};        ///< from there to the next one
  bool running = false;
  bool ended = false;
  std::optional<Error> error;  ///< of its end
};

/// What discretionary transfers wait for.
struct TransferConditions {
  bool onBattery = false;
  bool metered = false;
};

/// What background transfers need of their host. One for each session; called on the session's queue,
/// or from its callers' threads, one call at a time.
class BackgroundTransferHost {
 public:
  virtual ~BackgroundTransferHost() = default;

  // What is kept. These block on the disk; a failure that is no result is logged by the host.

  /// The transfers of which no end has been reported, in order of acceptance.
  virtual std::vector<BackgroundTransfer> unreported() = 0;
  /// Keeps a new transfer, and its body's bytes where it has one; from the return on it survives a
  /// power cut. Its identifier.
  virtual Expected<std::int64_t> accept(const BackgroundTransfer& transfer, std::string_view token,
                                        const std::filesystem::path& body) = 0;
  /// Keeps attempts, pause, whether it runs, and its end.
  virtual void note(const BackgroundTransfer& transfer) = 0;
  /// Nobody needs to hear of it again; its files are gone with that.
  virtual void noteReported(const BackgroundTransfer& transfer) = 0;
  virtual bool hasAccepted(std::string_view token, WallTime since) = 0;
  /// Where the response of a finished download lies; empty where the file is gone.
  virtual std::filesystem::path download(std::int64_t identifier) = 0;
  /// Nothing is left to run: what is open may be closed.
  virtual void rest() = 0;

  // How it runs.

  /// Called with the bytes of the body that have left.
  using Progress = Function<void(std::int64_t sent, std::int64_t expected)>;
  /// One attempt, not yet resumed. `completion` is called on any queue; the result needs no data, for a
  /// download's lie in a file by then. No response without its last byte is free of an error.
  virtual std::shared_ptr<HTTPDataTask> attempt(const BackgroundTransfer& transfer, Progress progress,
                                                HTTPSession::Completion completion) = 0;
  virtual TransferConditions conditions() = 0;
};

/// The background session over a runtime's timers, the same on every host: which transfer runs when,
/// and who is told. A session without a transfer has no timer; one whose transfers wait for better
/// conditions looks for them at the notification, and every kConditionsLook. A transfer's age is
/// measured by the wall clock between two processes, where a clock that went back counts as none, and
/// every process gives each transfer at least one attempt's time. A pause that has passed between two
/// processes is followed by a part of it, by chance.
class BackgroundTransfers final : public HTTPBackgroundSession {
 public:
  /// `center` posts that notification, and kPowerSourceDidChangeNotification. All references outlive the
  /// session.
  BackgroundTransfers(Runtime& runtime, NotificationCenter& center,
                      std::unique_ptr<BackgroundTransferHost> host,
                      HTTPBackgroundSessionConfiguration configuration,
                      HTTPBackgroundSessionDelegate& delegate);
  /// Stops what runs without an end, as the end of the process would: the next session of that
  /// identifier goes on with it. The delegate is not called from here on. Not on callbackQueue().
  ~BackgroundTransfers() override;

  Expected<std::int64_t> uploadTask(const HTTPRequest& request, const std::filesystem::path& body,
                                    std::string description, std::string_view token) override;
  Expected<std::int64_t> downloadTask(const HTTPRequest& request, std::string description,
                                      Duration window) override;
  bool hasAccepted(std::string_view token) override;
  void resume(std::int64_t identifier) override;
  void cancel(std::int64_t identifier) override;
  void getAllTasks(Function<void(std::vector<HTTPBackgroundTask>)> completion) override;
  SerialQueue& callbackQueue() override;

 private:
  class Core;
  const std::shared_ptr<Core> core_;  ///< held weakly by its timers and attempts
};

}  // namespace sable::platform
