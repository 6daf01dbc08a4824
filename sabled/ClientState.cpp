#include "sabled/ClientState.h"

#include <fmt/format.h>

#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLError.h"
#include "platform/NetworkServiceProxy.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/QueryCache.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"

namespace sable {
namespace {

/// How long a query may wait for the first bag.
constexpr platform::Duration kBagWait = std::chrono::seconds(1);
/// How long a connection to the service counts as warm after a request.
constexpr platform::Duration kWarmFor = std::chrono::seconds(30);

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategorySable);
}

std::optional<std::string> shortName(std::string_view identifier) {
  const auto name = extractClientNameFromString(identifier);
  return name ? std::optional<std::string>(*name) : std::nullopt;
}

}  // namespace

ClientState::ClientState(std::string identifier, Assembly& assembly)
    : assembly_(assembly),
      identifier_(std::move(identifier)),
      clientShortName_(shortName(identifier_)),
      queue_(assembly.runtime.serialQueue("com.kestrel.sabled.clientState")),
      bagFetchSemaphore_(assembly.runtime.semaphore(0)) {
  if (!assembly_.userDefaults.boolean("SBLNoQueryCache").value_or(false)) {
    queryCache_ = std::make_unique<QueryCache>(assembly_);
  }
  log().standard("query cache {} for {}", queryCache_ == nullptr ? "OFF" : "ON", identifier_);
  if (assembly_.sharedSession) {
    log().standard("Sable is using shared instance of guid controller");
    guidController_ = assembly_.guidController.get();
    sessionManager_ = assembly_.clientSessionManager.get();
  } else {
    ownGUIDController_ = std::make_unique<SableUserGUIDController>(assembly_);
    guidController_ = ownGUIDController_.get();
    log().standard("Sable is using individual instance of guid controller {}",
                   fmt::ptr(static_cast<const void*>(guidController_)));
    ownSessionManager_ = std::make_unique<ClientSessionManager>(assembly_, *guidController_, identifier_);
    sessionManager_ = ownSessionManager_.get();
  }
}

ClientState::~ClientState() = default;

std::optional<std::string> ClientState::userAgent() const {
  return queue_->sync([this] { return userAgent_; });
}

void ClientState::setUserAgent(std::string userAgent) {
  queue_->sync([&] { userAgent_ = std::move(userAgent); });
}

void ClientState::setConfiguration(SBLSessionConfiguration configuration) {
  queue_->sync([&] { configuration_ = std::move(configuration); });
}

std::shared_ptr<const SBLBag> ClientState::heldBag() const {
  return queue_->sync([this] { return bag_; });
}

void ClientState::bag(const std::string& userAgent, BagReply reply) {
  bool isNew = false;
  const bool hasAgent = queue_->sync([&] {
    isNew = !userAgent.empty() && userAgent_ != userAgent;
    if (isNew) {
      userAgent_ = userAgent;
      if (bag_ != nullptr) bag_ = std::make_shared<const SBLBag>(bag_->rawBag(), userAgent);
    }
    return userAgent_.has_value();
  });
  if (isNew && queryCache_ != nullptr) queryCache_->removeAllObjects();
  if (!hasAgent) return reply(nullptr, makeSBLError(SBLErrorCode::bagMissing, "no UserAgent"));
  if (!_ensureBag()) return reply(heldBag(), makeSBLError(SBLErrorCode::bagMissing, "timeout"));
  reply(heldBag(), std::nullopt);
}

bool ClientState::_ensureBag() {
  enum class Found { noAgent, held, missing };
  const Found found = queue_->sync([this] {
    if (!userAgent_) return Found::noAgent;
    if (bag_ != nullptr) return Found::held;
    if (!bagObservation_) {
      bagObservation_ = assembly_.notificationCenter.observe(
          std::string(kSBLBagChangeNotification),
          [weak = weak_from_this()](const platform::Notification& notification) {
            if (const auto self = weak.lock()) self->bagChangeNotification(notification);
          });
    }
    return Found::missing;
  });
  if (found != Found::missing) return found == Found::held;

  log().standard("Warming bag cache for agent: {}", userAgent().value_or(""));
  const auto current = assembly_.bagController->currentBag();
  if (current != nullptr) {
    queue_->sync([&] {
      // A newer one may have been announced meanwhile.
      if (bag_ == nullptr) bag_ = std::make_shared<const SBLBag>(current->rawBag(), *userAgent_);
    });
    return true;
  }
  _markNetworkRequest();
  // A signal may be left over from a bag of the past: what counts is whether one is held.
  (void)bagFetchSemaphore_->wait(assembly_.runtime.ticks() + kBagWait);
  return heldBag() != nullptr;
}

void ClientState::bagChangeNotification(const platform::Notification& notification) {
  if (const auto bag = bagFromNotification(notification)) {
    queue_->sync([&] { bag_ = std::make_shared<const SBLBag>(bag->rawBag(), userAgent_.value_or("")); });
  }
  bagFetchSemaphore_->signal();
}

void ClientState::_markNetworkRequest() {
  queue_->sync([this] { lastNetworkRequest_ = assembly_.runtime.ticks(); });
}

void ClientState::warm() {
  const auto& request = SableLogForCategory(SableLoggingCategoryRequest);
  const auto url = assembly_.bagController->warmURL();
  if (!url) {
    request.standard("warm not required, bag fetch in process");
    return;
  }
  const bool isWarm = queue_->sync([this] {
    const auto now = assembly_.runtime.ticks();
    if (lastNetworkRequest_ && now - *lastNetworkRequest_ < kWarmFor) return true;
    lastNetworkRequest_ = now;
    return false;
  });
  if (isWarm) {
    request.standard("warm not required, connection still warm");
    return;
  }
  auto warmRequest = assembly_.requestFactory->warmRequest(*url);
  std::string uuid = startWarmFeedback(warmRequest);
  const auto task = assembly_.urlSession().dataTask(
      std::move(warmRequest),
      [self = shared_from_this(), uuid = std::move(uuid)](const platform::HTTPResult& result) {
        SableLogForCategory(SableLoggingCategoryRequest)
            .standard("Status for warm request: ({}) error: ({})",
                      result.response ? result.response->status : 0,
                      result.error ? result.error->description() : "(null)");
        self->endWarmFeedback(result, uuid);
      });
  if (assembly_.useBramble()) enableProxy(*task);
  task->resume();
}

void ClientState::enableProxy(platform::HTTPDataTask& task) const {
  if (!assembly_.platform.networkServiceProxy().enable(task)) {
    SableLogForCategory(SableLoggingCategoryConnection).error("Enabling Bramble for request failed.");
  }
}

void ClientState::count(std::string_view event) {
  if (clientShortName_) assembly_.tally.add(createTallyKey(*clientShortName_, event), 1);
}

}  // namespace sable
