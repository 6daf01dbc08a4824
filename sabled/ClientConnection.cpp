#include "sabled/ClientConnection.h"

#include <fmt/format.h>

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/SBLTracing.h"
#include "platform/DeviceInfo.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientState.h"
#include "sabled/ClientStateManager.h"
#include "sabled/DownloadManager.h"
#include "sabled/KeyboardLocale.h"
#include "sabled/PrivacyReport.h"
#include "sabled/QueryCache.h"
#include "sabled/RequestReply.h"
#include "sabled/SableBagController.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SableLogging.h"
#include "sabled/SearchExplanation.h"
#include "sabled/UserAgent.h"

namespace sable {
namespace {

using platform::QualityOfService;
using platform::RelayRecord;

// Points of a query's way that a trace shows; the numbers are known to the tools that read it.
constexpr std::uint32_t kTraceSearchStart = 0x2b000004;
constexpr std::uint32_t kTraceSearchEnd = 0x2b000008;
constexpr std::uint32_t kTraceCard = 0x2b00000c;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryConnection);
}

/// What was typed before the newest search is no longer of interest.
bool isNewer(std::uint64_t queryId, std::uint64_t newest) {
  return queryId > newest;
}

}  // namespace

ClientConnection::ClientConnection(Assembly& assembly, std::shared_ptr<platform::RelayConnection> connection)
    : assembly_(assembly),
      connection_(std::move(connection)),
      transaction_(assembly.platform.transactions().open("clientConnection")),
      lastCall_(assembly.runtime.ticks()) {}

ClientConnection::~ClientConnection() {
  // For the other connections of that client too: peers depend on it.
  if (state_ != nullptr && state_->queryCache() != nullptr) state_->queryCache()->removeAllObjects();
}

void ClientConnection::start() {
  connection_->exportObject(kSBLDaemonRelay, [weak = weak_from_this()](platform::RelayCall call) {
    if (const auto self = weak.lock()) self->handleInvocation(std::move(call));
  });
  connection_->exportObject(kSBLDiagnosticsRelay, [weak = weak_from_this()](platform::RelayCall call) {
    if (const auto self = weak.lock()) self->diagnose(std::move(call));
  });
  armIdleTimer(kClientIdleTimeout);
  connection_->resume();
}

void ClientConnection::armIdleTimer(platform::Duration delay) {
  timer_ =
      assembly_.runtime.globalQueue(QualityOfService::background).after(delay, [weak = weak_from_this()] {
        if (const auto self = weak.lock()) self->idleTimerFired();
      });
}

void ClientConnection::idleTimerFired() {
  // A call only notes its time: the timer that was set before it finds out and waits for the rest.
  const platform::Duration silence = assembly_.runtime.ticks() - lastCall_.load();
  if (silence < kClientIdleTimeout) return armIdleTimer(kClientIdleTimeout - silence);
  log().debug("timing out idle relay connection");
  connection_->invalidate();
}

void ClientConnection::handleInvocation(platform::RelayCall call) {
  lastCall_ = assembly_.runtime.ticks();
  auto& arguments = call.arguments;
  switch (call.method) {
    case SBLDaemonRelay::configure:
      return configure(decodeConfiguration(std::get<RelayRecord>(arguments[0])), std::move(call.reply));
    case SBLDaemonRelay::bag:
      return bag(std::move(call.reply));
    case SBLDaemonRelay::request:
      return request(call);
    case SBLDaemonRelay::reportEvent:
    case SBLDaemonRelay::reportEventData:
      return reportEvent(call);
    case SBLDaemonRelay::feedback:
      return feedback(std::move(call.reply));
    case SBLDaemonRelay::listenToFlusher:
      _ensureState();
      return call.reply(assembly_.flusherRelayListener->endpoint());
    case SBLDaemonRelay::listSessions:
      return listSessions(std::move(call.reply));
    case SBLDaemonRelay::fileHandleAndAttributesForResource:
      return fileHandleAndAttributesForResource(std::get<std::string>(arguments[0]), std::move(call.reply));
    default:
      return;
  }
}

bool ClientConnection::_ensureState() {
  return _ensureState(userAgent_);
}

bool ClientConnection::_ensureState(const std::string& userAgent) {
  if (!configuration_) {
    log().fault("configuration must not be nil");
    return false;
  }
  if (!configuration_->identifier || userAgent.empty()) {
    log().fault("configuration requires identifier and agent");
    return false;
  }
  if (userAgent.size() > kMaximumNameBytes) {
    log().fault("user agent is longer than {} bytes", kMaximumNameBytes);
    return false;
  }
  userAgent_ = userAgent;
  if (state_ != nullptr) {
    if (state_->identifier() != *configuration_->identifier) log().fault("session identifier must match");
    return true;
  }
  state_ = assembly_.clientStateManager->stateForClientIdentifier(*configuration_->identifier);
  if (state_ != nullptr) state_->setConfiguration(*configuration_);
  return state_ != nullptr;
}

void ClientConnection::configure(SBLSessionConfiguration configuration, platform::RelayReply reply) {
  log().standard("client configuration {}", configuration.description());
  configuration_ = std::move(configuration);
  const auto agent =
      composeUserAgent(configuration_->userAgent.value_or(""), assembly_.platform.deviceInfo());
  if (!_ensureState(agent)) {
    reply.forget();
    return failConfiguration();
  }
  // Answered first: the client need not wait for the bag.
  reply(assembly_.clientStateManager->endpoint());
  state_->bag(userAgent_, [weak = weak_from_this()](const std::shared_ptr<const SBLBag>& bag,
                                                    const std::optional<Error>& error) {
    if (const auto self = weak.lock()) self->startServing(bag, error);
  });
}

void ClientConnection::failConfiguration() {
  ClientSessionManager::reportErrorAsSabledFeedback(
      makeSBLError(SBLErrorCode::daemonSide, "invalid configuration"), assembly_);
  log().fault("invalid configuration, closing connection");
  connection_->invalidate();
}

void ClientConnection::startServing(std::shared_ptr<const SBLBag> bag, std::optional<Error> error) {
  if (!bagObservation_) {
    bagObservation_ = assembly_.notificationCenter.observe(
        std::string(kSBLBagChangeNotification),
        [weak = weak_from_this()](const platform::Notification& notification) {
          if (const auto self = weak.lock()) self->bagChangeNotification(notification);
        });
    // What was announced before there was an observer is known to the state.
    if (auto held = state_->heldBag()) {
      bag = std::move(held);
      error = std::nullopt;
    }
  }
  if (bag == nullptr || !bag->feedbackEnabled()) {
    log().standard("feedback collection disabled in bag for user agent {}", userAgent_);
  }
  log().standard("sending bag with version: {} to client: {} error: {}",
                 bag == nullptr ? "(null)" : bag->version(), configuration_->identifier.value_or("(null)"),
                 error ? error->description() : "(null)");
  pushBag(bag.get(), error);
  assembly_.clientStateManager->saveState();
}

void ClientConnection::bagChangeNotification(const platform::Notification& notification) {
  const auto bag = bagFromNotification(notification);
  log().standard("bag change notification: {}", bag == nullptr ? "(null)" : bag->version());
  if (bag == nullptr) return;
  connection_->queue().async([weak = weak_from_this(), bag] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    const SBLBag seen(bag->rawBag(), self->userAgent_);
    self->pushBag(&seen, std::nullopt);
  });
}

void ClientConnection::pushBag(const SBLBag* bag, const std::optional<Error>& error) {
  platform::RelayArguments arguments{bag == nullptr ? std::string() : compactJSON(*bag->rawBag()),
                                     bag == nullptr ? userAgent_ : bag->userAgent(), encodeError(error)};
  // Some clients never answer: one answer at a time is waited for, for as long as they may be silent.
  if (std::exchange(awaitsPush_, true)) {
    return connection_->send(kSBLClientRelay, SBLClientRelay::bagDidLoad, std::move(arguments));
  }
  connection_->call(kSBLClientRelay, SBLClientRelay::bagDidLoad, std::move(arguments), kClientIdleTimeout,
                    [weak = weak_from_this()](const Expected<platform::RelayArguments>& result) {
                      if (const auto self = weak.lock()) self->pushAnswered(result);
                    });
}

void ClientConnection::pushAnswered(const Expected<platform::RelayArguments>& result) {
  awaitsPush_ = false;
  if (result) return;
  const auto code = static_cast<platform::RelayErrorCode>(result.error().code);
  if (code == platform::RelayErrorCode::disconnected || code == platform::RelayErrorCode::timedOut) return;
  log().error("(pid:{}) remote proxy error: {}", connection_->peer().pid, result.error().description());
}

void ClientConnection::bag(platform::RelayReply reply) {
  if (!_ensureState()) return reply.forget();
  state_->bag(userAgent_, [reply = std::move(reply)](const std::shared_ptr<const SBLBag>& bag,
                                                     const std::optional<Error>& error) mutable {
    reply(bag == nullptr ? std::string() : compactJSON(*bag->rawBag()),
          bag == nullptr ? std::string() : bag->userAgent(), encodeError(error));
  });
}

void ClientConnection::fillDefaults(SBLRequest& request) const {
  if (!request.keyboardInputMode) {
    request.keyboardInputMode = currentKeyboardInputMode(assembly_.platform.inputModes());
    log().info("keyboardInputMode property not set, using {}", *request.keyboardInputMode);
  }
  if (request.scale == 0.0) {
    request.scale = assembly_.platform.deviceInfo().mainScreenScale();
    log().info("request scale property not set, using {:f}", request.scale);
  }
}

void ClientConnection::request(platform::RelayCall& call) {
  const bool hasState = _ensureState();
  auto decoded =
      decodeRequest(std::get<std::string>(call.arguments[0]), std::get<RelayRecord>(call.arguments[1]));
  // A record of another class, or one before any configuration, never gets an answer.
  if (!decoded || !hasState) return call.reply.forget();
  std::visit([this](auto& request) { fillDefaults(request); }, *decoded);
  SBLReplyHandler reply = replyHandler(std::move(call.reply));

  struct Router {
    ClientConnection& self;
    SBLReplyHandler& reply;
    void operator()(SBLSearchRequest& request) { self.search(request, std::move(reply)); }
    void operator()(SBLMoreResultsRequest& request) { self.state_->moreResults(request, std::move(reply)); }
    void operator()(SBLCardRequest& request) {
      SBLTracePoint(kTraceCard);
      self.state_->card(request, std::move(reply));
    }
    void operator()(SBLZeroKeywordRequest& request) { self.state_->zeroKeyword(request, std::move(reply)); }
    void operator()(SBLLookupRequest& request) { self.state_->lookup(request, std::move(reply)); }
    void operator()(SBLFlightLookupRequest& request) { self.state_->flightLookup(request, std::move(reply)); }
    void operator()(SBLFlightSearchRequest& request) { self.state_->flightSearch(request, std::move(reply)); }
  };
  std::visit(Router{*this, reply}, *decoded);
}

void ClientConnection::diagnose(platform::RelayCall call) {
  lastCall_ = assembly_.runtime.ticks();
  switch (call.method) {
    case SBLDiagnosticsRelay::explain:
      return explain(call);
    case SBLDiagnosticsRelay::privacy:
      return describePrivacy(std::move(call.reply));
    case SBLDiagnosticsRelay::resources:
      return describeResources(std::move(call.reply));
    default:
      return;
  }
}

void ClientConnection::describeResources(platform::RelayReply reply) {
  if (assembly_.downloadManager == nullptr) return reply(compactJSON(Dictionary::array()));
  assembly_.downloadManager->describeResources(
      [reply = std::move(reply)](const Dictionary& resources) mutable { reply(compactJSON(resources)); });
}

void ClientConnection::describePrivacy(platform::RelayReply reply) {
  if (!_ensureState()) return reply.fail("org.freedesktop.DBus.Error.InvalidArgs", "comes after Configure");
  SBLRequest input;
  fillDefaults(input);
  PrivacyReport report;
  state_->describePrivacy(input, report);
  reply(report.json());
}

void ClientConnection::explain(platform::RelayCall& call) {
  auto decoded =
      decodeRequest(std::get<std::string>(call.arguments[0]), std::get<RelayRecord>(call.arguments[1]));
  auto* request = decoded ? std::get_if<SBLSearchRequest>(&*decoded) : nullptr;
  if (request == nullptr || !_ensureState()) {
    return call.reply.fail("org.freedesktop.DBus.Error.InvalidArgs",
                           "explains a SBLSearchRequest, after Configure");
  }
  fillDefaults(*request);
  SearchExplanation why;
  const std::uint64_t newest = currentQueryId_.load();
  if (why.gate("query id", fmt::format("{}", request->queryId), fmt::format("greater than {}", newest),
               isNewer(request->queryId, newest))) {
    state_->explain(*request, why);
  }
  call.reply(why.json());
}

void ClientConnection::search(const SBLSearchRequest& request, SBLReplyHandler reply) {
  SBLTracePoint(kTraceSearchStart);
  const std::uint64_t queryId = request.queryId;
  std::uint64_t current = currentQueryId_.load();
  if (!isNewer(queryId, current) || !currentQueryId_.compare_exchange_strong(current, queryId)) {
    reply(queryId, std::nullopt, std::nullopt);
    SBLTracePoint(kTraceSearchEnd);
    return;
  }
  state_->search(request,
                 [self = shared_from_this(), reply = std::move(reply)](
                     std::uint64_t id, std::optional<SBLReply> answer, std::optional<Error> error) mutable {
                   if (self->currentQueryId_.load() > id) {
                     // A newer search has superseded this one: its client no longer shows what was found.
                     answer.reset();
                     error.reset();
                   }
                   reply(id, std::move(answer), std::move(error));
                   SBLTracePoint(kTraceSearchEnd);
                 });
}

void ClientConnection::listSessions(platform::RelayReply reply) {
  _ensureState();
  platform::RelayRecords records;
  for (const auto& session : assembly_.clientStateManager->sessions()) {
    RelayRecord& record = records.emplace_back();
    record.add("identifier", session.identifier);
    record.add("agent", session.agent);
  }
  reply(std::move(records));
}

void ClientConnection::fileHandleAndAttributesForResource(const std::string& identifier,
                                                          platform::RelayReply reply) {
  _ensureState();
  platform::FileAttributes attributes;
  const auto file = openResource(identifier, attributes);
  if (!file) return reply(platform::RelayFile{}, RelayRecord{}, encodeError(file.error()));
  RelayRecord record;
  record.add("size", attributes.size);
  record.add("creationDate", platform::secondsSince1970(attributes.creationDate));
  reply(platform::RelayFile{*file}, std::move(record), encodeError(std::nullopt));
}

Expected<std::shared_ptr<const int>> ClientConnection::openResource(const std::string& identifier,
                                                                    platform::FileAttributes& attributes) {
  const auto refused = [&](std::string_view why) {
    return tl::unexpected(
        makeSBLError(SBLErrorCode::daemonSide, fmt::format("identifier: {} exception: {}", identifier, why)));
  };
  if (assembly_.downloadManager == nullptr) return refused("no download manager");
  const auto file = assembly_.downloadManager->fileHandleForResource(identifier, attributes);
  if (file) return (*file)->descriptor();
  if (file.error().domain == kSBLErrorDomain) return refused(file.error().reason);
  return tl::unexpected(file.error());
}

void ClientConnection::flushSession(platform::Function<void(const std::optional<std::string>&)> callback) {
  connection_->queue().async([self = shared_from_this(), callback = std::move(callback)]() mutable {
    auto* manager = self->state_ == nullptr ? nullptr : self->state_->sessionManager();
    if (manager == nullptr) return callback(std::nullopt);
    manager->flushSession([agent = self->state_->userAgent().value_or(""),
                           callback = std::move(callback)]() mutable { callback(agent); });
  });
}

void ClientConnection::flushSessionInvalidation(platform::Function<void(bool)> callback) {
  auto* manager = state_ == nullptr ? nullptr : state_->sessionManager();
  if (manager == nullptr) return callback(false);  // nothing was recorded
  manager->flushSessionInvalidationWithAgent(userAgent_, std::move(callback));
}

}  // namespace sable
