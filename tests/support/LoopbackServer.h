#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/host/HostRuntime.h"

namespace sable::tests {

/// A server on 127.0.0.1 that says exactly the bytes a test gives it, right or wrong. A connection
/// stays open for the next request unless the reply ends it.
class LoopbackServer {
 public:
  struct Reply {
    std::string bytes;
    enum class Then { keep, close, reset, stall } then = Then::keep;
  };
  /// Gets the request as it came: request line, headers, empty line, body.
  using Handler = std::function<Reply(const std::string& request)>;

  explicit LoopbackServer(platform::host::HostRuntime& runtime);
  ~LoopbackServer();

  /// Answers requests of this path; the last handler set for a path counts.
  void on(const std::string& path, Handler handler);
  void on(const std::string& path, Reply reply) {
    on(path, [reply](const std::string&) { return reply; });
  }
  void on(const std::string& path, std::string bytes) { on(path, Reply{std::move(bytes)}); }

  std::string url(const std::string& path) const;
  std::uint16_t port() const;

  /// Requests as they came.
  std::vector<std::string> requests() const;
  int connections() const;
  /// Waits until clients have closed all their connections.
  void waitUntilNoneIsOpen();

  /// "HTTP/1.1 200 OK", the header lines given, a Content-Length, and the body.
  static std::string ok(const std::string& body, const std::string& headerLines = "");

 private:
  class State;
  class Connection;
  std::shared_ptr<State> state_;
};

}  // namespace sable::tests
