#include "sabled/ClientStateManager.h"

#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/ClientState.h"
#include "sabled/ImageLoad.h"
#include "sabled/RequestReply.h"
#include "sabled/ResponseImages.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"
#include "sabled/SearchResponse.h"

namespace sable {
namespace {

using platform::RelayConnection;

constexpr std::string_view kSessionsKey = "sessions";
/// Endpoint connections at one time; one more waits a moment for a place.
constexpr unsigned kMaximumEndpointConnections = 10;
constexpr platform::Duration kConnectWait = std::chrono::milliseconds(100);

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryConnection);
}

platform::MonotonicTime monotonicTime(std::uint64_t nanoseconds) {
  constexpr auto kEnd = static_cast<std::uint64_t>(platform::Duration::max().count());
  return platform::MonotonicTime(platform::Duration(std::min(nanoseconds, kEnd)));
}

}  // namespace

ClientStateManager::ClientStateManager(Assembly& assembly)
    : assembly_(assembly),
      connectSemaphore_(assembly.runtime.semaphore(kMaximumEndpointConnections)),
      persistSessions_(assembly.userDefaults.boolean("SBLPersistSessions").value_or(false)),
      stateCacheQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.stateCache")),
      imageHostsQueue_(assembly.runtime.concurrentQueue("com.kestrel.sabled.imageHostsQueue")),
      connectionsQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.endpointConnections")),
      listener_(assembly.platform.relay().anonymousListener()) {
  listener_->setAcceptHandler([this](const std::shared_ptr<RelayConnection>& connection) {
    return acceptEndpointConnection(connection);
  });
  if (const auto resumed = listener_->resume(); !resumed) {
    log().error("cannot open the endpoint: {}", resumed.error().description());
  }
}

ClientStateManager::~ClientStateManager() = default;

std::shared_ptr<ClientState> ClientStateManager::stateForClientIdentifier(const std::string& identifier) {
  if (identifier.empty()) {
    log().fault("client session identifier cannot be nil or empty");
    return nullptr;
  }
  if (identifier.size() > kMaximumNameBytes) {
    log().fault("client session identifier is longer than {} bytes", kMaximumNameBytes);
    return nullptr;
  }
  auto state = stateCacheQueue_->sync([&] {
    auto& entry = stateCache_[identifier];
    if (entry == nullptr) entry = std::make_shared<ClientState>(identifier, assembly_);
    return entry;
  });
  log().info("using client state: {}", identifier);
  return state;
}

void ClientStateManager::loadState() {
  if (!persistSessions_) return;
  const auto saved = assembly_.userDefaults.array(kSessionsKey);
  if (!saved) return;
  stateCacheQueue_->sync([&] {
    for (const Dictionary& entry : *saved) {
      const auto identifier = stringMember(entry, "identifier");
      if (!identifier || identifier->empty()) continue;
      const auto state = std::make_shared<ClientState>(*identifier, assembly_);
      if (auto agent = stringMember(entry, "agent")) state->setUserAgent(std::move(*agent));
      stateCache_[*identifier] = state;
    }
  });
}

std::vector<ClientStateManager::Session> ClientStateManager::sessionsOnQueue() const {
  stateCacheQueue_->assertIsCurrent();
  std::vector<Session> sessions;
  for (const auto& [identifier, state] : stateCache_) {
    if (const auto agent = state->userAgent()) sessions.push_back({identifier, *agent});
  }
  return sessions;
}

void ClientStateManager::saveState() {
  if (!persistSessions_) return;
  stateCacheQueue_->async([this] {
    Dictionary saved = Dictionary::array();
    for (const Session& session : sessionsOnQueue()) {
      saved.push_back({{"identifier", session.identifier}, {"agent", session.agent}});
    }
    assembly_.userDefaults.set(kSessionsKey, saved);
    assembly_.userDefaults.synchronize();
  });
}

std::vector<ClientStateManager::Session> ClientStateManager::sessions() const {
  return stateCacheQueue_->sync([this] { return sessionsOnQueue(); });
}

platform::RelayEndpoint ClientStateManager::endpoint() const {
  return listener_->endpoint();
}

bool ClientStateManager::acceptEndpointConnection(const std::shared_ptr<RelayConnection>& connection) {
  log().debug("new endpoint connection");
  if (!connectSemaphore_->wait(assembly_.runtime.ticks() + kConnectWait)) {
    log().error("endpoint semaphore timeout");
    return false;
  }
  connection->exportObject(kSBLEndpointRelay,
                           [this](platform::RelayCall call) { handleEndpointCall(std::move(call)); });
  connection->setInvalidationHandler([this, weak = std::weak_ptr(connection)] {
    log().debug("endpoint connection invalidated");
    connectSemaphore_->signal();
    connectionsQueue_->async([this, ended = weak.lock()] { endpointConnections_.erase(ended); });
  });
  connectionsQueue_->sync([&] { endpointConnections_.insert(connection); });
  connection->resume();
  return true;
}

void ClientStateManager::handleEndpointCall(platform::RelayCall call) {
  using platform::RelayRecord;
  if (call.method == SBLEndpointRelay::loadImages) {
    return loadImages(decodeImageDescriptions(std::get<platform::RelayRecords>(call.arguments[0])),
                      std::get<std::uint64_t>(call.arguments[1]), [&](const Images& images) {
                        platform::RelayDataMap map;
                        for (const auto& [name, image] : images) map.entries.emplace_back(name, image);
                        call.reply(std::move(map));
                      });
  }
  auto request =
      decodeRequest(std::get<std::string>(call.arguments[0]), std::get<RelayRecord>(call.arguments[1]));
  if (!request) return call.reply.forget();
  this->request(*request, decodeConfiguration(std::get<RelayRecord>(call.arguments[2])),
                std::move(call.reply));
}

void ClientStateManager::request(const SBLAnyRequest& request, const SBLSessionConfiguration& configuration,
                                 platform::RelayReply reply) {
  const auto state = stateForClientIdentifier(configuration.identifier.value_or(""));
  if (state == nullptr) {
    const std::uint64_t queryId = std::visit([](const auto& one) { return one.queryId; }, request);
    sendRequestReply(
        reply, queryId, std::nullopt,
        makeSBLError(SBLErrorCode::daemonSide, "invalid configuration " + configuration.description()));
    return;
  }
  if (const auto* moreResults = std::get_if<SBLMoreResultsRequest>(&request)) {
    state->moreResults(*moreResults, replyHandler(std::move(reply)));
  } else if (const auto* card = std::get_if<SBLCardRequest>(&request)) {
    state->card(*card, replyHandler(std::move(reply)));
  } else {
    reply.forget();
  }
}

void ClientStateManager::loadImages(std::vector<SBLImageDescription> descriptions, std::uint64_t deadline,
                                    platform::Function<void(Images)> completion) {
  const auto bag = assembly_.bagController->currentBag();
  if (bag == nullptr) return completion({});
  if (descriptions.size() > kMaximumImagesPerCall) {
    SableLogForCategory(SableLoggingCategoryImages)
        .error("{} images asked for at once, {} are not looked at", descriptions.size(),
               descriptions.size() - kMaximumImagesPerCall);
    descriptions.resize(kMaximumImagesPerCall);
  }
  const auto load = std::make_shared<ImageLoad>(assembly_, bag);
  load->start(descriptions, validImageHosts());
  load->wait(monotonicTime(deadline));
  completion(load->images(descriptions));
}

void ClientStateManager::processImagesFromResponse(const SearchResponse& response, const SBLBag& bag) {
  std::set<std::string> hosts;
  enumerateImagesInResponse(response, bag, [&](const platform::URL& url) { hosts.insert(imageHost(url)); });
  if (hosts.empty()) return;
  imageHostsQueue_->barrierAsync([this, hosts = std::move(hosts)] { addImageHosts(hosts); });
}

void ClientStateManager::addImageHosts(const std::set<std::string>& hosts) {
  for (const std::string& host : hosts) {
    if (validImageHosts_.size() < kMaximumImageHosts) {
      validImageHosts_.insert(host);
    } else if (!validImageHosts_.contains(host) && !std::exchange(tooManyImageHosts_, true)) {
      SableLogForCategory(SableLoggingCategoryImages)
          .error("answers named more than {} hosts of images; no more are added", kMaximumImageHosts);
    }
  }
}

std::set<std::string> ClientStateManager::validImageHosts() const {
  return imageHostsQueue_->sync([this] { return validImageHosts_; });
}

}  // namespace sable
