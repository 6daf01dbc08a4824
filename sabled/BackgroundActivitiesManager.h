#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/HTTPBackgroundSession.h"
#include "platform/NotificationCenter.h"
#include "sabled/BackgroundFlusher.h"

namespace sable::platform {
class Activity;
}

namespace sable {

class Assembly;
class ClientSession;
class FileContainer;
class SableFeedbackFlusher;

/// Uploads complete sessions in the background: every 600 s, the first time 300 s after the start, each
/// file that the storage has is read, packed and handed to the upload session. Counts what becomes of the
/// uploads, also of those that an earlier process has begun. Any thread.
class BackgroundActivitiesManager final : public BackgroundFlusher,
                                          public platform::HTTPBackgroundSessionDelegate {
 public:
  explicit BackgroundActivitiesManager(Assembly& assembly);
  ~BackgroundActivitiesManager() override;

  bool stopFlushing() const override;
  void setStopFlushing(bool stop) override;
  void insertFlushActivity(int flag) override;

  void didSendBodyData(const platform::HTTPBackgroundTask& task, std::int64_t sent,
                       std::int64_t expected) override;
  void didCompleteWithError(const platform::HTTPBackgroundTask& task,
                            const std::optional<Error>& error) override;
  void didBecomeInvalidWithError(const std::optional<Error>& error) override;
  void didFinishEventsForBackgroundURLSession() override;

 private:
  /// What the work on the queue needs; work that is still queued keeps it alive.
  struct State;

  void registerActivity();

  Assembly& assembly_;
  const std::shared_ptr<State> state_;
  platform::NotificationCenter::Token startupObservation_;
};

}  // namespace sable
