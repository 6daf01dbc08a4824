#include "tests/support/TestClient.h"

#include <future>

namespace sable::test {

TestClient::TestClient(platform::host::HostRuntime& runtime, const std::string& address,
                       SBLSessionConfiguration configuration)
    : relay_(runtime, {}), client_(SBLClient::create(runtime, relay_, address, std::move(configuration))) {}

Answer TestClient::search(std::string text) {
  SBLSearchRequest search;
  search.queryId = ++lastQueryId_;
  search.queryString = std::move(text);
  search.verboseReply = true;
  return request(search);
}

Answer TestClient::request(const SBLAnyRequest& request) {
  std::promise<Answer> promise;
  client_->request(request, [&](std::uint64_t id, std::optional<SBLReply> reply, std::optional<Error> error) {
    promise.set_value({id, std::move(reply), std::move(error)});
  });
  return promise.get_future().get();
}

Expected<platform::RelayEndpoint> TestClient::connect() {
  std::promise<Expected<platform::RelayEndpoint>> promise;
  client_->connect([&](Expected<platform::RelayEndpoint> result) { promise.set_value(std::move(result)); });
  return promise.get_future().get();
}

}  // namespace sable::test
