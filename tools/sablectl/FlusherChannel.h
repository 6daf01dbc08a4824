#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "SableKit/SBLRelayInterfaces.h"
#include "tools/sablectl/Host.h"

namespace sable::sablectl {

/// What the daemon says on the flusher control channel.
struct FlusherEvent {
  enum class Kind { workDone, feedback, sessions, dropped, ended };
  Kind kind = Kind::ended;
  std::vector<std::string> texts;  ///< JSON, of feedback and sessions
  std::uint64_t count = 0;         ///< of dropped records
  platform::RelayReply reply;      ///< tells the daemon that there is room for another
};

/// The tool's end of the flusher control channel. Main thread.
class FlusherChannel {
 public:
  /// Connects to the endpoint that ListenToFlusher told.
  static Expected<std::unique_ptr<FlusherChannel>> open(Host& host, const platform::RelayEndpoint& endpoint);
  ~FlusherChannel();

  /// Tells what is wanted; does not wait for the answer: a refusal ends the channel.
  void ask(SBLFlusherIntent intent, platform::Duration timeout);
  /// The next event; waits for it until `deadline`. The daemon keeps what comes after a certain number
  /// of events whose replies were not sent.
  std::optional<FlusherEvent> next(platform::MonotonicTime deadline);

 private:
  struct Inbox;
  FlusherChannel(std::shared_ptr<platform::RelayConnection> connection, std::shared_ptr<Inbox> inbox);

  const std::shared_ptr<platform::RelayConnection> connection_;
  const std::shared_ptr<Inbox> inbox_;  ///< shared with the connection's handlers
};

}  // namespace sable::sablectl
