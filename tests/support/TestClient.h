#pragma once

#include <memory>
#include <optional>
#include <string>

#include "SableKit/SBLClient.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"

namespace sable::test {

/// What a request ended with.
struct Answer {
  std::uint64_t queryId = 0;
  std::optional<SBLReply> reply;
  std::optional<Error> error;

  /// "" where there is none.
  std::string data() const { return reply && reply->data ? *reply->data : std::string(); }
  std::string reason() const { return error ? error->reason : std::string(); }
  bool isClean() const { return reply && !error; }
};

/// An application with the client library, on real threads, that waits for what it asks.
class TestClient {
 public:
  TestClient(platform::host::HostRuntime& runtime, const std::string& address,
             SBLSessionConfiguration configuration = {"test", "test/1"});

  /// A verbose search with the next query id.
  Answer search(std::string text);
  Answer request(const SBLAnyRequest& request);
  /// The endpoint's address, or why there is no connection.
  Expected<platform::RelayEndpoint> connect();
  void disconnect() { client_->disconnect(); }
  SBLClient& client() { return *client_; }

 private:
  platform::host::HostRelay relay_;
  std::shared_ptr<SBLClient> client_;
  std::uint64_t lastQueryId_ = 0;
};

}  // namespace sable::test
