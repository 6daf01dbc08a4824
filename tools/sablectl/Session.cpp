#include "tools/sablectl/Session.h"

#include <utility>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "platform/RelaySupport.h"

namespace sable::sablectl {

using platform::RelayArguments;
using platform::RelayRecord;

Session::Session(Host& host, SBLSessionConfiguration configuration, platform::Duration timeout)
    : runtime_(host.runtime),
      timeout_(timeout),
      client_(SBLClient::create(host.runtime, host.relay, host.endpointOf(host.socket),
                                std::move(configuration))) {
  client_->setTimeout(timeout);
}

Session::~Session() {
  client_->disconnect();
}

/// Starts something and waits for what it calls back with; nullopt when that took too long.
template <class Result, class Start>
std::optional<Result> Session::await(Start start, platform::Duration grace) {
  // The handler may come after the waiting has ended.
  struct State {
    std::unique_ptr<platform::Semaphore> done;
    std::optional<Result> result;
  };
  const auto state = std::make_shared<State>(State{runtime_.semaphore(0), std::nullopt});
  const auto deadline = runtime_.ticks() + timeout_ + grace;
  start([state](Result result) {
    state->result = std::move(result);
    state->done->signal();
  });
  if (!state->done->wait(deadline)) return std::nullopt;
  return std::move(state->result);
}

Expected<void> Session::connect() {
  auto endpoint =
      await<Expected<platform::RelayEndpoint>>([&](auto done) { client_->connect(std::move(done)); });
  if (!endpoint) return platform::relayTimedOut();
  return endpoint->map([](const platform::RelayEndpoint&) {});
}

Answer Session::request(const SBLAnyRequest& request) {
  return this->request(std::string(requestClassName(request)), encodeRequest(request));
}

Answer Session::request(const std::string& className, const RelayRecord& record) {
  const auto start = runtime_.ticks();
  auto answer = await<Answer>([&](auto done) {
    client_->request(
        className, record,
        [done](std::uint64_t queryId, std::optional<SBLReply> reply, std::optional<Error> error) {
          done(Answer{queryId, std::move(reply), std::move(error)});
        });
  });
  if (!answer) {
    answer.emplace();
    answer->queryId = record.unsignedInteger("queryId").value_or(0);
    answer->error = platform::relayTimedOut().value();
  }
  answer->verbose = record.boolean("verboseReply").value_or(false);
  answer->milliseconds = platform::toSeconds(runtime_.ticks() - start) * 1e3;
  return std::move(*answer);
}

Expected<Bag> Session::bag() {
  auto bag = await<Expected<Bag>>([&](auto done) {
    client_->bag([done](std::string json, std::string userAgent, std::optional<Error> error) {
      if (error) return done(tl::unexpected(std::move(*error)));
      done(Bag{std::move(json), std::move(userAgent)});
    });
  });
  if (!bag) return platform::relayTimedOut();
  return std::move(*bag);
}

Expected<SBLClient::Images> Session::loadImages(const std::vector<SBLImageDescription>& descriptions) {
  auto images = await<Expected<SBLClient::Images>>(
      [&](auto done) { client_->loadImages(descriptions, runtime_.ticks() + timeout_, std::move(done)); },
      std::chrono::seconds(1));
  if (!images) return platform::relayTimedOut();
  return std::move(*images);
}

Expected<RelayArguments> Session::call(const platform::RelayInterface& interface, std::size_t method,
                                       RelayArguments arguments) {
  auto result = await<Expected<RelayArguments>>(
      [&](auto done) { client_->call(interface, method, std::move(arguments), std::move(done)); });
  if (!result) return platform::relayTimedOut();
  return std::move(*result);
}

ExitCode exitCodeFor(const Error& error) {
  const bool timedOut = error.domain == platform::kRelayErrorDomain &&
                        error.code == static_cast<std::int64_t>(platform::RelayErrorCode::timedOut);
  return timedOut ? kExitTimeout : kExitError;
}

}  // namespace sable::sablectl
