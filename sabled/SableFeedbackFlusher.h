#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class ClientSession;
class SBLBag;

/// Packs sessions and hands them to the upload session. Of each its envelope is written as JSON, compressed,
/// to a temporary file; the request carries the SHA-512 of the JSON.
///
/// What becomes of a session's file (its storageHandle):
///
///     accepted for upload                     --> deleted: the upload has its own copy by then
///     no endpoint, or one that is none        --> deleted: nobody wants it
///     no room on the disk, or the disk fails  --> available again, for the next run
///
/// Any thread. The bag's changes reach it by themselves.
class SableFeedbackFlusher {
 public:
  /// Which of the service's two addresses: 0 crowdsourcing, 1 feedback; another has none.
  SableFeedbackFlusher(Assembly& assembly, int identifier);
  ~SableFeedbackFlusher();

  /// Where feedback is sent: the bag's URL with the query "v=2". Nothing for what is no URL.
  static std::optional<std::string> getServerEndpointForFeedback(const std::optional<std::string>& url);

  /// Sessions that are sent from here on go there; later. Nothing: they are dropped.
  void setEndpoint(std::optional<std::string> url);

  /// Puts the session into the buffer, later, and calls back on the buffer's queue; `callback` may be empty.
  void flush(std::shared_ptr<ClientSession> session, platform::Function<void()> callback);
  void flushSyncFromArray(std::vector<std::shared_ptr<ClientSession>> sessions);
  /// Forgets the buffer, later. Files stay held until the next start.
  void dropFeedbacks();

  // Send what is in the buffer. Each waits for the disk on the buffer's queue.
  void flushToWireAsync();
  /// The envelopes that were packed, as JSON, when `returnObjects` is set; else nothing.
  std::vector<std::string> flushToWireSync(bool returnObjects);

  std::size_t countOfDatabuffer() const;
  std::vector<std::shared_ptr<ClientSession>> sessionBuffer() const;

  // How many records each upload carries, as long as this process knows.
  void setFeedbacksPerTask(std::int64_t task, std::int64_t count);
  std::optional<std::int64_t> getFeedbackCountForTask(std::int64_t task) const;
  void removeFeedbacksForTask(std::int64_t task);

 private:
  enum class Outcome { accepted, dropped, kept };
  struct Packed;

  void bagChangeNotification(const platform::Notification& notification);
  void _fetchEndpointFromBag(const SBLBag* bag);
  void _flush(std::shared_ptr<ClientSession> session);
  std::vector<std::string> flushToWireWithObjectsReturned(bool returnObjects);
  Outcome send(ClientSession& session, std::vector<std::string>* objects);
  Outcome packAndUpload(ClientSession& session, const std::filesystem::path& file,
                        std::vector<std::string>* objects);
  Expected<Packed> pack(ClientSession& session, const std::filesystem::path& file);
  Outcome upload(const ClientSession& session, const std::filesystem::path& file, const Packed& packed);
  void settle(ClientSession& session, Outcome outcome);
  std::filesystem::path temporaryFile();
  void removeTemporaryFile(const std::filesystem::path& file);

  Assembly& assembly_;
  const int identifier_;
  const std::shared_ptr<platform::SerialQueue> queueBuffer_, queueCompression_, feedbackCountQueue_;

  // On queueBuffer_.
  std::optional<std::string> serverEndpoint_;
  std::vector<std::shared_ptr<ClientSession>> sessionBuffer_;

  std::map<std::int64_t, std::int64_t> feedbacksPerTask_;  ///< by task; on feedbackCountQueue_

  platform::NotificationCenter::Token bagObservation_;
};

}  // namespace sable
