#include "sabled/QueryCache.h"

#include <fmt/format.h>

#include <atomic>
#include <utility>

#include "platform/CountryConfiguration.h"
#include "platform/LocaleInfo.h"
#include "platform/Lowercase.h"
#include "platform/ManagedConfiguration.h"
#include "platform/MemoryPressure.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/CritbitTree.h"
#include "sabled/QueryCacheDecision.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UTF16Length.h"

namespace sable {
namespace {

using Entry = std::shared_ptr<const CachedResultSet>;
using Tree = CritbitTree<const CachedResultSet>;

/// On each the service might answer otherwise than it did.
constexpr struct {
  std::string_view name;
  bool changesRequests;  ///< an answer that is on its way was asked for in vain
} kClearingNotifications[] = {
    {kSBLUserGUIDChangeNotification, false},
    {kSBLSessionSoftLimitNotification, false},
    {kSBLSessionMaxLimitNotification, false},
    {platform::kCountryCodeDidChangeNotification, true},
    {platform::kSystemTimeZoneDidChangeNotification, true},
    {platform::kCurrentLocaleDidChangeNotification, true},
    {platform::kEffectiveSettingsDidChangeNotification, true},
};

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryCaching);
}

QueryCacheQuestion questionOf(const SBLSearchRequest& request, platform::WallTime now) {
  QueryCacheQuestion question;
  question.key = platform::lowercased(request.queryString);
  question.length = lengthInUTF16(question.key);
  question.scale = nearestFloat(request.scale);
  question.now = now;
  return question;
}

void logCandidates(const QueryCacheDecision& decision) {
  for (const auto& [candidate, outcome] : decision.rows) {
    if (outcome != QueryCacheOutcome::chosen && outcome != QueryCacheOutcome::noHigherScore) continue;
    log().debug("entry {} prefix: {} input: {} score: {:f}", fmt::ptr(candidate.get()), candidate->query,
                candidate->input, candidate->completionScore);
  }
}

}  // namespace

/// The tree and what it costs. All but the constructor runs on `queue`.
class QueryCache::Entries : public std::enable_shared_from_this<Entries> {
 public:
  explicit Entries(Assembly& assembly)
      : queue(assembly.runtime.serialQueue("com.kestrel.sable.queryCache")),
        memoryPressure_(assembly.platform.memoryPressure()) {}

  const std::shared_ptr<platform::SerialQueue> queue;
  std::atomic<std::uint64_t> generation = 0;  ///< any thread's

  Entry find(const QueryCacheQuestion& question, QueryCacheDecision* decision);
  void set(const Entry& entry);
  void _clearCache();
  std::size_t count() const { return tree_.count(); }

 private:
  void _didBecomeNonEmpty();
  void _didBecomeEmpty();

  platform::MemoryPressure& memoryPressure_;
  Tree tree_;
  std::uint64_t currentCost_ = 0;
  std::unique_ptr<platform::MemoryPressure::Source> memoryPressureSource_;  ///< while not empty
};

Entry QueryCache::Entries::find(const QueryCacheQuestion& question, QueryCacheDecision* decision) {
  queue->assertIsCurrent();
  const Entry* choice = nullptr;
  std::vector<Entry> expired;
  tree_.keysMatchingPrefix(question.key, [&](const char*, const Entry& candidate) {
    const auto outcome = judgeCandidate(*candidate, choice == nullptr ? nullptr : choice->get(), question);
    if (outcome == QueryCacheOutcome::chosen) choice = &candidate;
    if (outcome == QueryCacheOutcome::expired) expired.push_back(candidate);
    if (decision != nullptr) decision->add(candidate);
  });
  Entry found = choice == nullptr ? nullptr : *choice;
  if (decision != nullptr) decision->settle(found.get());
  // What they cost stays charged: the account is settled by a flush alone.
  for (const Entry& entry : expired) tree_.removeObjectForKey(entry->query);
  if (!expired.empty() && tree_.count() == 0) _didBecomeEmpty();
  return found;
}

void QueryCache::Entries::set(const Entry& entry) {
  queue->assertIsCurrent();
  const std::uint64_t cost = entry->cost() + kBookkeeping;
  if (cost >= kBudget) {
    log().error("NOT caching '{}' with cost {}", entry->query, cost);
    return;
  }
  log().info("caching '{}' with cost {}", entry->query, cost);
  if (currentCost_ + cost >= kBudget) {
    log().standard("!!! exceeded max cost, flushing cache !!!");
    _clearCache();
  }
  currentCost_ += cost;
  const std::size_t before = tree_.count();
  tree_.setObject(entry, entry->query);
  if (before == 0 && tree_.count() == 1) _didBecomeNonEmpty();
}

void QueryCache::Entries::_clearCache() {
  queue->assertIsCurrent();
  if (tree_.count() == 0) return;
  tree_.removeAllObjects();
  currentCost_ = 0;
  _didBecomeEmpty();
}

void QueryCache::Entries::_didBecomeNonEmpty() {
  log().standard("query cache no longer empty");
  memoryPressureSource_ = memoryPressure_.onCritical(queue, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    log().standard("emptying caches under memory pressure");
    self->_clearCache();
  });
}

void QueryCache::Entries::_didBecomeEmpty() {
  log().standard("query cache became empty");
  memoryPressureSource_.reset();
}

QueryCache::QueryCache(Assembly& assembly)
    : assembly_(assembly), entries_(std::make_shared<Entries>(assembly)) {
  for (const auto& [name, changesRequests] : kClearingNotifications) {
    const auto _cacheClearNotification = [weak = std::weak_ptr(entries_),
                                          changesRequests = changesRequests](const platform::Notification&) {
      const auto entries = weak.lock();
      if (entries == nullptr) return;
      if (changesRequests) ++entries->generation;
      entries->queue->async([weak] {
        if (const auto alive = weak.lock()) alive->_clearCache();
      });
    };
    observations_.push_back(assembly.notificationCenter.observe(std::string(name), _cacheClearNotification));
  }
}

QueryCache::~QueryCache() = default;

Entry QueryCache::get(const std::string& input) {
  SBLSearchRequest request;
  request.queryString = input;
  return getRequest(request);
}

Entry QueryCache::getRequest(const SBLSearchRequest& request, QueryCacheDecision* decision) {
  QueryCacheDecision forLog;
  if (decision == nullptr && log().shows(platform::LogLevel::debug)) decision = &forLog;
  const QueryCacheQuestion question = questionOf(request, assembly_.runtime.now());
  log().info("cache lookup: {}", question.key);
  if (decision != nullptr) decision->question = question;
  Entry found = entries_->queue->sync([&] { return entries_->find(question, decision); });
  if (decision != nullptr) logCandidates(*decision);
  return found;
}

void QueryCache::set(Entry entry) {
  if (entry->data == nullptr || entry->query.empty() || !Tree::isKey(entry->query)) return;
  if (entry->inputLength > entry->queryLength) {
    log().error("BUG: NOT caching '{}' because input is longer than completed query '{}'", entry->input,
                entry->query);
    return;
  }
  entries_->queue->async([entries = entries_, entry = std::move(entry)] { entries->set(entry); });
}

std::uint64_t QueryCache::generation() const {
  return entries_->generation;
}

void QueryCache::removeAllObjects() {
  entries_->queue->sync([this] { entries_->_clearCache(); });
}

std::size_t QueryCache::count() const {
  return entries_->queue->sync([this] { return entries_->count(); });
}

}  // namespace sable
