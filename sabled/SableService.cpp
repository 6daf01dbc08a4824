#include "sabled/SableService.h"

#include <algorithm>
#include <filesystem>
#include <utility>

#include "SableKit/SBLConstants.h"
#include "platform/HTTPSession.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/ClientConnection.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientState.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"

namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryConnection);
}

}  // namespace

SableService::SableService(Assembly& assembly)
    : assembly_(assembly), queue_(assembly.runtime.serialQueue("com.kestrel.sable.serviceQueue")) {
  assembly_.sharedSession = assembly_.userDefaults.boolean(kSBLSharedSession).value_or(false);
  assembly_.guidController = std::make_unique<SableUserGUIDController>(assembly_);
  assembly_.clientSessionManager = std::make_unique<ClientSessionManager>(
      assembly_, *assembly_.guidController, std::string(kSBLServiceName));
  assembly_.flusherRelayListener =
      std::make_unique<SableFlusherRelay>(assembly_, [this] { return getClientConnections(); });
}

SableService::~SableService() = default;

std::optional<std::string> SableService::clientIDForConnection(
    const platform::RelayConnection& connection) const {
  const pid_t pid = connection.peer().pid;
  const auto path = assembly_.platform.relay().executablePath(pid);
  if (path) return std::filesystem::path(*path).filename().string();
  log().standard("error getting path for pid [{}] {}", pid, path.error().reason);
  return std::nullopt;
}

bool SableService::acceptConnection(const std::shared_ptr<platform::RelayConnection>& connection) {
  const pid_t pid = connection->peer().pid;
  const std::string clientID = clientIDForConnection(*connection).value_or("(null)");
  log().standard("new connection from {} ({})", clientID, pid);
  auto client = std::make_shared<ClientConnection>(assembly_, connection);
  connection->setInvalidationHandler([this, weak = std::weak_ptr(client), clientID, pid] {
    if (const auto ended = weak.lock()) connectionInvalidated(ended, clientID, pid);
  });
  addConnection(client, pid);
  assembly_.tally.add("com.kestrel.sabled.clientconnection", 1);
  client->start();
  return true;
}

void SableService::addConnection(std::shared_ptr<ClientConnection> connection, pid_t pid) {
  queue_->async([this, connection = std::move(connection), pid]() mutable {
    connections_.push_back(std::move(connection));
    const auto sameProcess = std::ranges::count_if(
        connections_, [pid](const auto& other) { return other->connection().peer().pid == pid; });
    // Tells, and deliberately does no more: a process may have good reasons for several.
    if (sameProcess >= 2) log().error("too many connections {} from pid {}", sameProcess, pid);
  });
}

void SableService::connectionInvalidated(const std::shared_ptr<ClientConnection>& connection,
                                         const std::string& clientID, pid_t pid) {
  log().standard("connection from {} ({}) invalidated", clientID, pid);
  queue_->async([this, connection] {
    connection->flushSessionInvalidation([this, connection](bool flushed) {
      log().standard("session {} on invalidation", flushed ? "flushed" : "not flushed");
      queue_->async([this, connection] { removeConnection(connection); });
    });
  });
  const auto& state = connection->state();
  if (state != nullptr && state->clientShortName()) {
    // The transposed letters are in every peer's dashboards.
    assembly_.tally.add(createTallyKey(*state->clientShortName(), "realyinvalidation"), 1);
  }
}

void SableService::removeConnection(const std::shared_ptr<ClientConnection>& connection) {
  queue_->assertIsCurrent();
  std::erase(connections_, connection);
  if (!connections_.empty()) return;
  auto& session = assembly_.urlSession();
  if (!session.hasCache()) return;
  log().standard("purging url cache");
  session.purgeMemoryCache();
}

std::vector<std::shared_ptr<ClientConnection>> SableService::getClientConnections() const {
  return queue_->sync([this] { return connections_; });
}

}  // namespace sable
