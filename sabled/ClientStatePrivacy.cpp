#include "SableKit/SBLBag.h"
#include "platform/ManagedConfiguration.h"
#include "sabled/AppWhitelistController.h"
#include "sabled/Assembly.h"
#include "sabled/ClientStateQuery.h"
#include "sabled/PrivacyReport.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UserAgent.h"

// What this client's requests, and the daemon's own, would tell of the device: each is built as if it
// were sent, and kept.
namespace sable {
namespace {

/// Where a request goes whose URL comes from elsewhere.
constexpr const char* kSomewhere = "https://somewhere.invalid/";

template <class Request>
Request likeInput(const SBLRequest& input) {
  Request request;
  static_cast<SBLRequest&>(request) = input;
  return request;
}

/// Why the service would not be asked, or null.
const char* obstacle(const SBLBag* bag) {
  if (bag == nullptr) return "there is no bag yet";
  if (!bag->isEnabled()) return "the bag does not enable it for this agent";
  return bag->searchURL() ? nullptr : "the bag does not say where";
}

}  // namespace

void ClientState::describePrivacy(const SBLRequest& input, PrivacyReport& report) {
  _ensureBag();
  report.bag = heldBag();
  report.userAgent = userAgent().value_or("");
  const auto guid = guidController_->current();
  report.userGuid = guid.guid;
  report.userGuidRotatesIn = platform::toSeconds(guid.expires - assembly_.runtime.now());
  if (assembly_.appWhitelistController != nullptr) {
    report.signedApplications = assembly_.appWhitelistController->signedApplications();
  }
  report.diagnosticsAllowed = assembly_.platform.managedConfiguration().diagnosticsSubmissionAllowed();
  describeQueries(input, report);
  describeOwnRequests(report);
}

void ClientState::describeQueries(const SBLRequest& input, PrivacyReport& report) {
  SBLNetworkRequestFactory& factory = *assembly_.requestFactory;
  const char* why = obstacle(report.bag.get());
  // `build` traces a request of a kind, under the field mask that its queries have.
  const auto describe = [&](const char* name, const QueryKind& kind, const auto& build) {
    if (why != nullptr) return report.unasked.push_back({name, why});
    const Query query = makeQuery(kind, input, "", {});
    PrivacyReport::Request& request = report.requests.emplace_back();
    request.name = name;
    request.throughProxy = routesThroughProxy(query);
    build(query.fieldMask, &request.trace);
  };
  const SBLBag* bag = report.bag.get();
  const UUID& guid = report.userGuid;
  describe("search", kSearch, [&](unsigned mask, RequestTrace* trace) {
    factory.searchRequest(likeInput<SBLSearchRequest>(input), *bag, guid, mask, trace);
  });
  describe("zero keyword", kZeroKeyword, [&](unsigned mask, RequestTrace* trace) {
    factory.zeroKeywordRequest(likeInput<SBLZeroKeywordRequest>(input), *bag, guid, mask, trace);
  });
  describe("more results", kMoreResults, [&](unsigned mask, RequestTrace* trace) {
    auto request = likeInput<SBLMoreResultsRequest>(input);
    request.moreResultsURL = kSomewhere;
    factory.moreResultsRequest(request, *bag, guid, mask, trace);
  });
  describe("lookup", kLookup, [&](unsigned, RequestTrace* trace) {
    factory.lookupRequest(likeInput<SBLLookupRequest>(input), *bag, guid, trace);
  });
  describe("card", kCard, [&](unsigned, RequestTrace* trace) {
    auto request = likeInput<SBLCardRequest>(input);
    request.cardURL = kSomewhere;
    factory.cardRequest(request, *bag, guid, trace);
  });
}

void ClientState::describeOwnRequests(PrivacyReport& report) const {
  SBLNetworkRequestFactory& factory = *assembly_.requestFactory;
  const auto describe = [&](const char* name, const char* why, const auto& build) {
    if (why != nullptr) return report.unasked.push_back({name, why});
    PrivacyReport::Request& request = report.requests.emplace_back();
    request.name = name;
    build(&request.trace);
  };
  const SBLBag* bag = report.bag.get();
  describe("bag", nullptr, [&](RequestTrace* trace) {
    const std::string agent = sabledUserAgent(assembly_.platform.deviceInfo());
    factory.bagFetchRequest(*assembly_.bagController, agent, "", trace);
  });
  describe("download", bag == nullptr ? "there is no bag yet" : nullptr,
           [&](RequestTrace* trace) { factory.fileDownloadRequest(kSomewhere, "", true, trace); });
  const bool uploads = bag != nullptr && bag->feedbackEnabled() && bag->feedbackURL();
  describe("upload", uploads ? nullptr : "the bag collects no feedback from this agent",
           [&](RequestTrace* trace) { factory.flusherUploadRequest(kSomewhere, 0, "", trace); });
}

}  // namespace sable
