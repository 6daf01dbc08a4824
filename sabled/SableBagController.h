#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Dictionary.h"
#include "platform/HTTPSession.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"
#include "sabled/BagCacheFile.h"

namespace sable {

class Assembly;
class SBLBag;

/// Posted after every bag install, on the installing thread; the bag stands under
/// kSBLNotificationBagKey.
inline constexpr std::string_view kSBLBagChangeNotification = "SBLBagChangeNotification";

/// The bag of a "SBLBagChangeNotification", or null.
std::shared_ptr<const SBLBag> bagFromNotification(const platform::Notification& notification);

/// Whether version `a` is older than `b`: digits compare as numbers, so that "9" is older than "10".
bool isOlderVersion(std::string_view a, std::string_view b);

/// Owns the one bag that the daemon uses: fetches it, keeps it in memory and in a file, decides
/// when it is out of date and announces each new one.
///
///     no bag --fetch succeeds--> bag --10 minutes before expiry, or its URL changed--> stale bag
///     stale bag --fetch succeeds--> bag; --fetch fails--> stale bag, tried again when next asked
///
/// A stale bag is still served. One fetch runs at a time; one asked for meanwhile is dropped. Any
/// thread.
class SableBagController {
 public:
  explicit SableBagController(Assembly& assembly);
  ~SableBagController();

  /// Where the bag of a country is: the setting "SBLBagURL" when it is a URL, else the deployment's
  /// endpoint for "CN" or for the rest of the world.
  std::string bagFetchURLWithCountry(std::string_view countryCode) const;

  /// The bag, which may be stale, or null after starting a fetch.
  std::shared_ptr<const SBLBag> currentBag();
  std::optional<std::string> warmURL();
  /// The bag as it is held, or null; whether it is stale is not looked at, which costs a request's URL.
  std::shared_ptr<const SBLBag> inMemoryBag() const;

  /// What the service announced: {"bag": newest version}. Fetches when the bag in memory is older.
  void forceFetchBag(const Dictionary& announcement);

 private:
  using Bag = std::shared_ptr<const SBLBag>;

  Bag cachedBagState();
  void cacheBagState(const Bag& bag, bool fromDisk);
  std::shared_ptr<const Dictionary> diskCachedBagDictionary();
  std::shared_ptr<const Dictionary> cacheBagDictionary(Dictionary dictionary);
  bool _isRefreshRequiredForCachedBag(const Dictionary& cached);
  void _handleRefreshNotification();
  void _fetchBagStateWithVersion(const std::string& version);
  struct FetchRecord;
  /// Opens the session of a fetch.
  FetchRecord beginRecord(const platform::HTTPRequest& request) const;
  void fetchDidComplete(const FetchRecord& record, const platform::HTTPResult& result);
  Expected<Bag> bagFromResult(const platform::HTTPResult& result);

  Assembly& assembly_;
  const std::string userAgent_;
  const BagCacheFile file_;
  const std::shared_ptr<platform::ConcurrentQueue> inMemoryBagCacheAccessQueue_;
  std::atomic<bool> fetchInProgress_{false};

  Bag inMemoryBag_;  ///< read and written on inMemoryBagCacheAccessQueue_
  platform::NotificationCenter::Token refreshObservation_;
};

}  // namespace sable
