#include "sabled/SableBagController.h"

#include <any>
#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "platform/Notify.h"
#include "platform/Tally.h"
#include "platform/Transaction.h"
#include "platform/URL.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientSession.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SBLRetryableNetworkRequest.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UserAgent.h"

namespace sable {
namespace {

using platform::HTTPResult;
using platform::QualityOfService;

constexpr std::size_t kMaximumBagBytes = 4u << 20;
constexpr unsigned kFetchRetries = 5;
constexpr double kBagLifetime = 14400;        // seconds
constexpr double kRefreshBeforeExpiry = 600;  // seconds

// Keys that the controller adds to the dictionary it keeps; the service never sends them.
constexpr const char* kExpirationKey = "__expiration";
constexpr const char* kBagURLCacheKey = "__bagurl";
constexpr const char* kRefreshDisabledKey = "__refresh_disabled";

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryBag);
}

/// Whether the bag offers the service to the news client: 0, 1, or 2 when there is no bag.
unsigned newsStatus(const SBLBag* bag) {
  constexpr unsigned kUnknown = 2;
  return bag == nullptr ? kUnknown : SBLBag(bag->rawBag(), "news/1.0").isEnabled();
}

Error networkError(std::string reason) {
  return makeSBLError(SBLErrorCode::network, std::move(reason));
}

std::string_view leadingDigits(std::string_view text) {
  return text.substr(0, std::min(text.find_first_not_of("0123456789"), text.size()));
}

}  // namespace

std::shared_ptr<const SBLBag> bagFromNotification(const platform::Notification& notification) {
  const auto found = notification.userInfo.find(std::string(kSBLNotificationBagKey));
  if (found == notification.userInfo.end()) return nullptr;
  const auto* bag = std::any_cast<std::shared_ptr<const SBLBag>>(&found->second);
  return bag == nullptr ? nullptr : *bag;
}

bool isOlderVersion(std::string_view a, std::string_view b) {
  while (!a.empty() && !b.empty()) {
    std::string_view left = leadingDigits(a), right = leadingDigits(b);
    if (left.empty() || right.empty()) {
      if (a.front() != b.front()) return a.front() < b.front();
      a.remove_prefix(1);
      b.remove_prefix(1);
      continue;
    }
    a.remove_prefix(left.size());
    b.remove_prefix(right.size());
    left.remove_prefix(std::min(left.find_first_not_of('0'), left.size()));
    right.remove_prefix(std::min(right.find_first_not_of('0'), right.size()));
    if (left.size() != right.size()) return left.size() < right.size();
    if (left != right) return left < right;
  }
  return a.empty() && !b.empty();
}

/// A fetch's session; every feedback in it has the session's agent and user GUID.
struct SableBagController::FetchRecord {
  std::string uuid;
  std::shared_ptr<ClientSession> session;

  void add(feedback::Message message) const {
    session->addFeedback(
        std::make_shared<SableFeedback>(std::move(message), 0, session->userGuid(), session->agent()));
  }
};

SableBagController::SableBagController(Assembly& assembly)
    : assembly_(assembly),
      userAgent_(sabledUserAgent(assembly.platform.deviceInfo())),
      file_(assembly.fileManager),
      inMemoryBagCacheAccessQueue_(
          assembly.runtime.concurrentQueue("com.kestrel.sabled.bagcontroller.cacheaccess")) {
  if (auto cached = diskCachedBagDictionary()) {
    cacheBagState(std::make_shared<const SBLBag>(std::move(cached), userAgent_), true);
  }
  refreshObservation_ = assembly_.notificationCenter.observe(
      std::string(kSBLBagRefreshRequired), [this](const platform::Notification& notification) {
        if (notification.object == assembly_.requestFactory.get()) _handleRefreshNotification();
      });
}

SableBagController::~SableBagController() = default;

std::string SableBagController::bagFetchURLWithCountry(std::string_view countryCode) const {
  const auto& defaults = assembly_.userDefaults;
  std::string chosen = defaults.string("SBLBagURL").value_or("");
  if (!chosen.empty()) {
    if (platform::URL::parse(chosen)) return chosen;
    log().error("Malformed sable bag URL in user defaults key {}", "SBLBagURL");
  }
  if (lowercasedASCII(countryCode) == "cn") {
    return defaults.string("SBLDefaultBagURLCN").value_or("https://search-cn.kestrel.invalid/bag");
  }
  return defaults.string("SBLDefaultBagURL").value_or("https://search.kestrel.invalid/bag");
}

SableBagController::Bag SableBagController::inMemoryBag() const {
  return inMemoryBagCacheAccessQueue_->sync([this] { return inMemoryBag_; });
}

SableBagController::Bag SableBagController::currentBag() {
  Bag bag = cachedBagState();
  if (bag == nullptr) _fetchBagStateWithVersion("");
  return bag;
}

std::optional<std::string> SableBagController::warmURL() {
  const Bag bag = currentBag();
  return bag == nullptr ? std::nullopt : bag->warmURL();
}

void SableBagController::forceFetchBag(const Dictionary& announcement) {
  const auto announced = announcement.is_object() ? announcement.find("bag") : announcement.end();
  if (announced == announcement.end() || !announced->is_number()) return;
  const std::string version = announced->dump();
  const Bag bag = inMemoryBag();
  if (isOlderVersion(bag == nullptr ? std::string_view() : bag->version(), version)) {
    _fetchBagStateWithVersion(version);
  }
}

SableBagController::Bag SableBagController::cachedBagState() {
  Bag bag = inMemoryBag();
  if (bag != nullptr && _isRefreshRequiredForCachedBag(*bag->rawBag())) {
    assembly_.runtime.globalQueue(QualityOfService::standard).async([this] {
      _fetchBagStateWithVersion("");
    });
  }
  return bag;
}

void SableBagController::cacheBagState(const Bag& bag, bool fromDisk) {
  if (bag == nullptr) return;
  for (const std::string& problem : bag->problems()) log().error("{}", problem);
  const unsigned newNewsStatus = newsStatus(bag.get());
  unsigned oldNewsStatus = newNewsStatus;
  inMemoryBagCacheAccessQueue_->barrierSync([&] {
    oldNewsStatus = newsStatus(inMemoryBag_.get());
    inMemoryBag_ = bag;
  });
  // Outside the barrier: observers read the bag.
  assembly_.notificationCenter.post(
      {kSBLBagChangeNotification, nullptr, {{std::string(kSBLNotificationBagKey), std::any(bag)}}});
  // The first bag from the network always tells (the old status is "unknown"), one from disk
  // never does: readers of the notification count on both.
  if (newNewsStatus == oldNewsStatus || fromDisk) return;
  log().standard("setting Sable News Available status to {}", newNewsStatus);
  assembly_.platform.notify().post(newNewsStatus == 1 ? kSBLNotifyEnabled : kSBLNotifyDisabled);
}

std::shared_ptr<const Dictionary> SableBagController::diskCachedBagDictionary() {
  if (!assembly_.diskBagCacheEnabled()) {
    log().standard("skipping check for bag on disk because the flag is disabled");
    return nullptr;
  }
  auto dictionary = file_.read();
  if (dictionary != nullptr && _isRefreshRequiredForCachedBag(*dictionary)) _fetchBagStateWithVersion("");
  return dictionary;
}

std::shared_ptr<const Dictionary> SableBagController::cacheBagDictionary(Dictionary dictionary) {
  dictionary[kExpirationKey] = platform::secondsSince1970(assembly_.runtime.now()) + kBagLifetime;
  dictionary[kBagURLCacheKey] = assembly_.requestFactory->bagCacheRequest(*this, userAgent_, "").url;
  if (assembly_.diskBagCacheEnabled()) {
    file_.write(dictionary);
  } else {
    log().standard("skipping writing bag to disk because the flag is disabled");
  }
  return std::make_shared<const Dictionary>(std::move(dictionary));
}

bool SableBagController::_isRefreshRequiredForCachedBag(const Dictionary& cached) {
  if (cached.contains(kRefreshDisabledKey)) {
    log().info("Bag refresh is disabled.");
    return false;
  }
  const double expiration = numberMember(cached, kExpirationKey).value_or(0);
  const double interval = expiration - platform::secondsSince1970(assembly_.runtime.now());
  if (interval < kRefreshBeforeExpiry) {
    log().standard("bag expired: {:f}", interval);
    assembly_.tally.add("com.kestrel.sabled.bag.expired", 1);
    return true;
  }
  const auto cachedURL = stringMember(cached, kBagURLCacheKey);
  if (!cachedURL) {
    log().standard("no bag URL found in cache");
    return true;
  }
  const std::string url = assembly_.requestFactory->bagCacheRequest(*this, userAgent_, "").url;
  if (url == *cachedURL) return false;
  log().standard("bag url changed from: {} to {}", *cachedURL, url);
  return true;
}

void SableBagController::_handleRefreshNotification() {
  log().standard("something significant changed (locale, geo). checking to see if bag needs update");
  const Bag bag = inMemoryBag();
  if (_isRefreshRequiredForCachedBag(bag == nullptr ? Dictionary::object() : *bag->rawBag()))
    _fetchBagStateWithVersion("");
}

void SableBagController::_fetchBagStateWithVersion(const std::string& version) {
  if (fetchInProgress_.exchange(true)) return;
  auto transaction = assembly_.platform.transactions().open("bagFetch");
  auto request = std::make_shared<SBLRetryableNetworkRequest>();
  request->httpRequest = assembly_.requestFactory->bagFetchRequest(*this, userAgent_, version);
  request->delayOnFail = true;
  log().standard("Initiating bag fetch attempt with request {} header {}", request->httpRequest.url,
                 request->httpRequest.headers.description());
  auto completion = [this, transaction = std::move(transaction), record = beginRecord(request->httpRequest)](
                        const HTTPResult& result) { fetchDidComplete(record, result); };
  dataTaskWithRetryableRequest(assembly_.runtime, assembly_.bagSession(), std::move(request), 1,
                               kFetchRetries, std::move(completion))
      ->resume();
}

SableBagController::FetchRecord SableBagController::beginRecord(const platform::HTTPRequest& request) const {
  const std::string uuid = assembly_.runtime.uuid().string();
  auto start =
      feedback::startNetworkSearch(assembly_.runtime.ticks(), {.triggerEvent = feedback::kBagTrigger,
                                                               .endpoint = feedback::Endpoint::sableBag,
                                                               .input = "",
                                                               .request = request,
                                                               .uuid = uuid});
  // The first fetch may be under way before there are user GUIDs.
  std::optional<UUID> userGuid;
  if (assembly_.guidController != nullptr) userGuid = assembly_.guidController->currentUserGUID();
  const auto first = std::make_shared<SableFeedback>(std::move(start), 0, userGuid, userAgent_);
  return {uuid, std::make_shared<ClientSession>(assembly_, first)};
}

void SableBagController::fetchDidComplete(const FetchRecord& record, const HTTPResult& result) {
  log().info("resp: {}", result.response ? result.response->description() : "(null)");
  record.add(feedback::endNetworkSearch(assembly_.runtime.ticks(), feedback::endOf(result, record.uuid)));
  const Expected<Bag> bag = bagFromResult(result);
  if (bag) {
    cacheBagState(*bag, false);
    assembly_.tally.add("com.kestrel.sabled.bag.fetches", 1);
  } else {
    record.add(feedback::error(assembly_.runtime.ticks(), bag.error()));
    assembly_.tally.add("com.kestrel.sabled.bag.fetchesfailed", 1);
  }
  record.session->sessionComplete();
  fetchInProgress_ = false;
}

Expected<SableBagController::Bag> SableBagController::bagFromResult(const HTTPResult& result) {
  if (result.error) {
    log().error("Error fetching bag: {}", result.error->description());
    return tl::unexpected(*result.error);
  }
  if (result.data == nullptr) {
    log().error("Error fetching bag: returned data was not of the expected type.");
    return tl::unexpected(networkError("no data"));
  }
  if (const int status = result.response->status; status != 200) {
    log().error("Error fetching bag status code: {}", status);
    return tl::unexpected(networkError("statusCode " + std::to_string(status)));
  }
  auto parsed = parseJSON(*result.data, kMaximumBagBytes);
  if (!parsed || !parsed->is_object()) {
    log().error("Error fetching bag: returned data was not of the expected type.");
    if (!parsed) log().error("error parsing bag json {}", parsed.error().description());
    return tl::unexpected(networkError("not JSON object"));
  }
  log().info("Got bag: {}", *result.data);
  return std::make_shared<const SBLBag>(cacheBagDictionary(std::move(*parsed)), userAgent_);
}

}  // namespace sable
