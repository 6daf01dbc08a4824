#include "sabled/ClientStateQuery.h"

// The kinds of query and what tells them apart.
namespace sable {

const ClientState::QueryKind ClientState::kSearch{
    .category = SableLoggingCategorySearch,
    .performing = "session {0} performing query[{1}] {2}, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached query {2}.",
    .bagDisabled = "no search, bag disabled",
    .dispatching = "Dispatching network request for (id, query): ({1}, {2})",
    .gotResponse = "Got network response for (id, query): ({1}, {2})",
    .mayUseProxy = true,
    .retries = 0,
    .delayOnFail = false,
    .hasMinimumLength = true,
    .isRecorded = true,
};

const ClientState::QueryKind ClientState::kZeroKeyword{
    .category = SableLoggingCategoryZeroKeyword,
    .performing = "session {0} performing zkw query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached zkw query.",
    .bagDisabled = "no zkw, bag disabled",
    .dispatching = "Dispatching network request for zkw query",
    .gotResponse = "Got network response for zkw query",
    .mayUseProxy = false,
    .retries = 0,
    .delayOnFail = false,
    .isRecorded = true,
};

const ClientState::QueryKind ClientState::kLookup{
    .category = SableLoggingCategoryLookUp,
    .performing = "session {0} performing lookup query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached lookup query.",
    .bagDisabled = "no lookup, bag disabled",
    .dispatching = "Dispatching network request for lookup query",
    .gotResponse = "Got network response for lookup query",
    .mayUseProxy = true,
    .retries = 2,  // within the time a rendered page waits for them
    .delayOnFail = false,
    .isRecorded = true,
};

const ClientState::QueryKind ClientState::kMoreResults{
    .category = SableLoggingCategoryMoreResults,
    .performing = "session {0} performing more results query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached more results query.",
    .bagDisabled = "no more results, bag disabled",
    .dispatching = "Dispatching network request for more results query",
    .gotResponse = "Got network response for more results query",
    .mayUseProxy = true,
    .retries = 2,  // a person waits: two more tries, a moment apart
    .delayOnFail = true,
    .fetchFailed = "More results fetch failed with HTTP status code {} error {}",
    .expectsObject = true,
};

const ClientState::QueryKind ClientState::kCard{
    .category = SableLoggingCategoryCard,
    .performing = "session {0} performing card query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached card query.",
    .bagDisabled = "no card, bag disabled",
    .dispatching = "Dispatching network request for card query",
    .gotResponse = "Got network response for card query",
    .mayUseProxy = true,
    .retries = 2,
    .delayOnFail = true,
    .fetchFailed = "Card fetch failed with HTTP status code {} error {}",
    .expectsObject = true,
};

}  // namespace sable
