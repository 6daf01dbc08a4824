#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/FileManager.h"
#include "platform/Function.h"
#include "platform/Runtime.h"
#include "sabled/FeedbackSession.h"

namespace sable {

class Assembly;
class FileContainer;
class SessionProcessingHelper;

/// What one client reported between two session boundaries.
///
///     made --feedback--> each goes to the session's file at once, and is not kept in memory
///          --sessionComplete--> the file is closed and waits for the flusher
///     read back: the file is mapped, and its feedback read when needed --getFeedbacksToSend--> the
///     upload's envelope
///
/// Used on one queue at a time, its owner's; what `sessionFeedbacks` holds is safe on any.
class ClientSession final : public FeedbackSession {
 public:
  /// A session that begins now, with the agent and user GUID of its first feedback, which may be
  /// null, and a file of its own. `previousSessionEndReason` says why the one before it ended.
  ClientSession(Assembly& assembly, const std::shared_ptr<SableFeedback>& feedback,
                std::uint32_t previousSessionEndReason = 0);
  ~ClientSession() override;

  /// A session as data() gave it; null when the bytes are none.
  static std::shared_ptr<ClientSession> initWithData(Assembly& assembly, std::string_view data);
  /// A new session of the daemon's own that holds the error.
  static std::shared_ptr<ClientSession> createFeedbackSessionFromError(const Error& error,
                                                                       Assembly& assembly);

  /// The session without its feedback: a `_SKClientSession`.
  std::string data() const;

  /// Also tells the service when a feedback is not of the session's user GUID.
  void addFeedback(std::shared_ptr<SableFeedback> feedback) override;
  /// Hands the file over to the storage.
  void sessionComplete();

  /// Of a session that was read back they are made anew each time.
  SableFeedbacks getSessionFeedbacks() override;
  std::size_t countOfSessionFeedbacks();
  /// A record of the file that the session is read back from, and what it says. The bytes are kept by
  /// setFile(), which follows; the feedback is not kept, but read again whenever it is needed.
  void addSessionFeedbacks(std::string_view record, const SableFeedback& feedback);
  void setFile(std::unique_ptr<platform::ReadableFile> file);
  Dictionary feedbacksWithRelativeTimestamp() override;
  Dictionary privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks& feedbacks) override;
  /// The upload's envelope of a session that was read back. Once: its feedback is processed.
  Dictionary getFeedbacksToSend();
  /// The same as JSON, and likewise once: compactJSON() of it, handed out in pieces so that it is never
  /// in memory as a whole.
  void writeFeedbacksToSend(const std::function<void(std::string_view)>& write);

  void enumerateSessions(const std::function<void(ClientSession&, bool)>& callback) override;

  const std::string& agent() const { return agent_; }  ///< empty: none
  void setAgent(std::string agent) { agent_ = std::move(agent); }
  const std::string& userGuidString() const { return userGuidString_; }  ///< empty: none
  std::optional<UUID> userGuid() override { return userGuid_; }
  void setUserGuid(std::optional<UUID> userGuid) override;
  std::optional<platform::WallTime> sessionStart() const;
  void setSessionStart(std::optional<platform::WallTime> date);
  /// Versions of the downloaded resources at the session's start, by identifier.
  const std::map<std::string, std::string>& resourceVersions() const { return cpResourceVersions_; }
  void setResourceVersions(std::map<std::string, std::string> versions);
  bool firstUseOfTheDay() const { return firstUseOfTheDay_; }
  std::uint32_t previousSessionEndReason() const { return previousSessionEndReason_; }
  bool removeTimestamps() const { return removeTimestamps_; }
  /// The session's file; null where there could be none.
  const std::shared_ptr<FileContainer>& storageHandle() const { return storageHandle_; }
  void setStorageHandle(std::shared_ptr<FileContainer> container) { storageHandle_ = std::move(container); }

 private:
  explicit ClientSession(Assembly& assembly);

  /// Feedback in file_.
  struct StoredFeedback {
    std::string_view record;
    std::uint64_t timestamp = 0;
    bool hasIdentifiers = false;
  };
  using RecordVisitor = std::function<void(const SableFeedback& record)>;

  void begin(const SableFeedback* feedback);
  void visitRecordsToSend(const SableFeedbacks& feedbacks, const RecordVisitor& visit);
  void visitStoredRecordsToSend(const RecordVisitor& visit);
  void visitMissing(const SessionProcessingHelper& helper, const RecordVisitor& visit);
  SableFeedback read(const StoredFeedback& stored) const;
  Dictionary envelopeBehindFeedback();
  bool _firstUseOfTheDay(const std::string& agent);
  bool _updateFirstUseDate(platform::WallTime date, const std::string& agent);
  void _addFeedback(const std::shared_ptr<SableFeedback>& feedback);
  platform::Function<void()> keepWhenWritten(std::shared_ptr<SableFeedback> feedback);

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> sessionQueue_, dateQueue_;
  const std::shared_ptr<SableFeedbacks> sessionFeedbacks_ =
      std::make_shared<SableFeedbacks>();  ///< on sessionQueue_

  std::string agent_;
  std::string userGuidString_;
  std::optional<UUID> userGuid_;  ///< what the string says
  bool removeTimestamps_ = false;
  std::optional<double> sessionStartSince1970_;  ///< seconds
  std::map<std::string, std::string> cpResourceVersions_;
  std::uint32_t previousSessionEndReason_ = 0;
  bool firstUseOfTheDay_ = false;
  std::shared_ptr<FileContainer> storageHandle_;
  std::unique_ptr<platform::ReadableFile> file_;  ///< null when the session was not read back
  std::vector<StoredFeedback> storedFeedbacks_;   ///< by time; not changed any more once there is file_

  std::optional<platform::WallTime> firstUseDate_;  ///< on dateQueue_
};

}  // namespace sable
