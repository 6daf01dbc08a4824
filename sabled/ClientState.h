#pragma once

#include <memory>
#include <optional>
#include <string>

#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "SableKit/SBLSessionConfiguration.h"
#include "platform/HTTPSession.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class CachedResultSet;
class ClientSessionManager;
class FeedbackMessage;
class QueryCache;
class RequestTrace;
class SBLBag;
class SableUserGUIDController;
struct PrivacyReport;
struct SableAnswer;
struct SearchExplanation;
struct SearchResponse;

/// Everything the daemon keeps for one client session identifier, shared by all connections that
/// present it, for the life of the process; and the road of each kind of query. Operations run on
/// the caller's queue and block it for at most the second that the first bag may take. Replies
/// arrive there or on the HTTP session's callback queue.
class ClientState : public std::enable_shared_from_this<ClientState> {
 public:
  ClientState(std::string identifier, Assembly& assembly);
  ~ClientState();

  const std::string& identifier() const { return identifier_; }
  /// The first known product that the identifier names ("rover"), for counters; or none.
  const std::optional<std::string>& clientShortName() const { return clientShortName_; }
  /// Null when the setting "SBLNoQueryCache" turned it off.
  QueryCache* queryCache() const { return queryCache_.get(); }
  std::shared_ptr<const SBLBag> heldBag() const;  ///< null: none yet
  /// Null when the daemon records no sessions.
  ClientSessionManager* sessionManager() const { return sessionManager_; }

  std::optional<std::string> userAgent() const;
  void setUserAgent(std::string userAgent);
  void setConfiguration(SBLSessionConfiguration configuration);

  using BagReply = platform::Function<void(std::shared_ptr<const SBLBag>, std::optional<Error>)>;
  /// The bag as `userAgent` sees it; a new agent rebuilds it and empties the query cache. Waits up
  /// to 1 s for the first bag, then answers with an error.
  void bag(const std::string& userAgent, BagReply reply);

  /// Opens a connection to the service ahead of a search, unless one was used within 30 s.
  void warm();

  // Each replies exactly once. Its gates, in order: a bag, a bag that enables the service for this
  // agent, and for searches enough text; a refused query is answered with neither reply nor error.
  // A search without forced query items may be answered from the query cache.
  void search(const SBLSearchRequest& request, SBLReplyHandler reply);
  void zeroKeyword(const SBLZeroKeywordRequest& request, SBLReplyHandler reply);
  void lookup(const SBLLookupRequest& request, SBLReplyHandler reply);
  void moreResults(const SBLMoreResultsRequest& request, SBLReplyHandler reply);
  void card(const SBLCardRequest& request, SBLReplyHandler reply);
  /// Accepted, and answered at once with nothing.
  void flightSearch(const SBLFlightSearchRequest& request, SBLReplyHandler reply);
  void flightLookup(const SBLFlightLookupRequest& request, SBLReplyHandler reply);

  /// Adds to `why` what search() would do with the request; nothing is asked, replied or counted.
  void explain(const SBLSearchRequest& request, SearchExplanation& why);
  /// Adds what this client's requests, and the daemon's own, would tell of the device now; nothing is sent.
  /// `input` has the members that clients leave to the daemon.
  void describePrivacy(const SBLRequest& input, PrivacyReport& report);

 private:
  struct QueryKind;
  struct Query;
  static const QueryKind kSearch, kZeroKeyword, kLookup, kMoreResults, kCard;

  bool _ensureBag();
  void bagChangeNotification(const platform::Notification& notification);
  void _markNetworkRequest();

  /// What the gates say of a query.
  enum class Verdict { bagMissing, bagDisabled, inputTooShort, passes };

  Query makeQuery(const QueryKind& kind, const SBLRequest& request, const std::string& input,
                  SBLReplyHandler reply) const;
  std::shared_ptr<Query> begin(const QueryKind& kind, const SBLRequest& request, const std::string& input,
                               SBLReplyHandler reply);
  /// Gives the query the bag that it is asked with. Notes each gate in `why`, if there is one.
  Verdict judge(Query& query, SearchExplanation* why);
  /// Answers a query that does not pass the gates.
  bool refuses(Query& query);
  /// nullptr: the cache has no answer, or it is not to be used.
  std::shared_ptr<const CachedResultSet> cachedAnswer(const SBLSearchRequest& request,
                                                      SearchExplanation* why) const;
  void answerFromCache(Query& query, const CachedResultSet& hit);
  std::optional<platform::HTTPRequest> searchRequest(const Query& query, const SBLSearchRequest& request,
                                                     RequestTrace* trace) const;
  void dispatch(const std::shared_ptr<Query>& query, std::optional<platform::HTTPRequest> request);
  void didComplete(Query& query, platform::HTTPResult result);
  std::optional<Error> processAnswer(const Query& query, const platform::HTTPResult& result);
  void _cacheResponse(const SearchResponse& response, const Query& query, const Data& data, const UUID& uuid);
  SBLReply replyWith(const Query& query, Data data) const;
  bool routesThroughProxy(const Query& query) const;
  void enableProxy(platform::HTTPDataTask& task) const;
  void describeQueries(const SBLRequest& input, PrivacyReport& report);
  void describeOwnRequests(PrivacyReport& report) const;
  void recordSearchResult(int status);
  void forceFetch(const platform::HTTPRequest& request);
  void count(std::string_view event);

  // What a query leaves in the client's session. None waits.
  bool isRecorded(const Query& query) const;
  void record(const Query& query, std::unique_ptr<FeedbackMessage> message) const;
  void skipSearchFeedback(const Query& query, Verdict verdict) const;
  void cacheHitFeedback(const Query& query, const CachedResultSet& hit) const;
  void startNetworkFeedback(const Query& query) const;
  void endNetworkFeedback(const Query& query, const platform::HTTPResult& result,
                          const SableAnswer& answer) const;
  void failSearchFeedback(const Query& query, const platform::HTTPResult& result) const;
  /// Records that a warm-up begins, as the daemon's own; its uuid is for the end.
  std::string startWarmFeedback(const platform::HTTPRequest& request) const;
  void endWarmFeedback(const platform::HTTPResult& result, const std::string& uuid) const;
  void recordOfDaemon(std::unique_ptr<FeedbackMessage> message) const;

  Assembly& assembly_;
  const std::string identifier_;
  const std::optional<std::string> clientShortName_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::unique_ptr<platform::Semaphore> bagFetchSemaphore_;
  std::unique_ptr<QueryCache> queryCache_;
  std::unique_ptr<SableUserGUIDController> ownGUIDController_;
  std::unique_ptr<ClientSessionManager> ownSessionManager_;
  SableUserGUIDController* guidController_;
  ClientSessionManager* sessionManager_;

  // On queue_, which never runs anything that waits.
  SBLSessionConfiguration configuration_;
  std::optional<std::string> userAgent_;
  std::shared_ptr<const SBLBag> bag_;
  std::optional<platform::MonotonicTime> lastNetworkRequest_;
  platform::NotificationCenter::Token bagObservation_;
};

}  // namespace sable
