#pragma once

#include <memory>
#include <optional>
#include <string>

#include "SableKit/SBLClient.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "tests/support/Answer.h"

namespace sable::test {

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
