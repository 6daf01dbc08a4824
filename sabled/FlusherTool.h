#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <vector>

#include "platform/Relay.h"
#include "platform/Runtime.h"

namespace sable {

/// What a tool may leave unanswered before the rest waits here, and what may wait before records are
/// left out. Both are far below what costs a peer its connection.
inline constexpr std::size_t kFlusherWindowCalls = 64;
inline constexpr std::size_t kFlusherWindowBytes = std::size_t{1} << 20;
inline constexpr std::size_t kFlusherWaitingCalls = 4096;
inline constexpr std::size_t kFlusherWaitingBytes = std::size_t{8} << 20;

/// A tool on the flusher control channel, and what is on its way to it: SBLFlusherListenerRelay, in
/// order. A tool that reads slowly, or not at all, holds nobody up: what finds no place is left out,
/// and as soon as there is place again the tool hears how many records that was, at the place where
/// they are missing. On the relay's queue.
class FlusherTool : public std::enable_shared_from_this<FlusherTool> {
 public:
  FlusherTool(std::shared_ptr<platform::RelayConnection> connection,
              std::shared_ptr<platform::SerialQueue> queue);

  void workDone();
  void receiveFeedback(std::string json);
  void receiveSessions(std::vector<std::string> envelopes);
  /// Whether a record would be left out now: it need not even be made. Once one is, all are until
  /// nothing waits any more, so that what the tool gets is of one piece.
  bool isFull() const;
  /// Counts records that were left out.
  void leaveOut(std::uint64_t records);

  platform::RelayPeer peer() const { return connection_->peer(); }

 private:
  struct Waiting {
    std::size_t method;
    platform::RelayArguments arguments;
    std::size_t bytes;
  };

  void add(std::size_t method, platform::RelayArguments arguments, std::size_t bytes, std::size_t records);
  void tellLeftOut();
  void enqueue(std::size_t method, platform::RelayArguments arguments, std::size_t bytes);
  void sendWhatFits();
  void answered(std::size_t bytes, const Expected<platform::RelayArguments>& answer);

  const std::shared_ptr<platform::RelayConnection> connection_;
  const std::shared_ptr<platform::SerialQueue> queue_;

  std::deque<Waiting> waiting_;
  std::size_t waitingBytes_ = 0;
  std::size_t unanswered_ = 0, unansweredBytes_ = 0;
  std::uint64_t leftOut_ = 0;  ///< and not yet told
};

}  // namespace sable
