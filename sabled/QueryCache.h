#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "SableKit/SBLRequest.h"
#include "platform/NotificationCenter.h"

namespace sable {

class Assembly;
class CachedResultSet;
struct QueryCacheDecision;

/// Keeps result sets of one client under the queries that they complete, and answers later
/// keystrokes from them: an entry answers what is typed when its query begins with it and it was
/// made for an input no longer. Empties itself when something that shapes the service's answers
/// changes (user GUID, session limits, country, time zone, locale, restrictions) and when memory
/// runs short, for which it listens only while it holds something.
///
/// Any thread: everything happens on a serial queue of its own, on which nothing waits.
class QueryCache {
 public:
  /// At this many bytes, data and kBookkeeping of every entry since the last flush, the cache is
  /// flushed whole.
  static constexpr std::uint64_t kBudget = 2097152;
  static constexpr std::uint64_t kBookkeeping = 1024;

  explicit QueryCache(Assembly& assembly);
  ~QueryCache();

  /// The entry that answers `input` on a screen of any scale, or null.
  std::shared_ptr<const CachedResultSet> get(const std::string& input);

  /// The entry that answers the request, or null: of those with the shortest query the one with the
  /// highest score, the first where scores are equal or none is above 0. Forgets expired entries
  /// that it meets. Fills `decision`, if there is one, with what became of each candidate.
  std::shared_ptr<const CachedResultSet> getRequest(const SBLSearchRequest& request,
                                                    QueryCacheDecision* decision = nullptr);

  /// Keeps an entry, later, in the place of one with the same query. Left out are those without data
  /// or query, with a zero byte in the query, made for an input longer than the query, or so large
  /// that they would fill the budget alone.
  void set(std::shared_ptr<const CachedResultSet> entry);

  /// Another one when what was asked for before is not worth keeping: locale, country, time zone or
  /// restrictions have changed since.
  std::uint64_t generation() const;

  void removeAllObjects();
  std::size_t count() const;

 private:
  class Entries;

  Assembly& assembly_;
  const std::shared_ptr<Entries> entries_;  ///< held weakly by what may run after the cache is gone
  std::vector<platform::NotificationCenter::Token> observations_;
};

}  // namespace sable
