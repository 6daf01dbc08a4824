#include "sabled/SBLNetworkRequestFactory.h"

#include <utility>

#include "SableKit/SBLBag.h"
#include "platform/NetworkServiceProxy.h"
#include "sabled/Assembly.h"
#include "sabled/SableBagController.h"
#include "sabled/SableURLRequestBuilder.h"
#include "sabled/UserAgent.h"

namespace sable {

using platform::HTTPCachePolicy;
using platform::HTTPRequest;

template <class Steps>
HTTPRequest SBLNetworkRequestFactory::build(std::string_view url, Steps steps, RequestTrace* trace) {
  return contextAccessQueue_->sync([&] {
    auto builder = Builder::requestBuilderWithURL(url, trace);
    if (!builder) {
      // A request that nobody can send: its task ends with the error that says so.
      HTTPRequest unusable;
      unusable.url = std::string(url);
      return unusable;
    }
    steps(*builder);
    return builder->createMutableUrlRequest();
  });
}

HTTPRequest SBLNetworkRequestFactory::proxiedIfEnabled(HTTPRequest request) const {
  const auto& proxy = assembly_.platform.networkServiceProxy();
  if (!assembly_.useBramble() || !proxy.isEnabled()) return request;
  return proxy.brambleRequest(std::move(request));
}

std::string SBLNetworkRequestFactory::createUserAgentString(std::string_view product) const {
  return composeUserAgent(product, assembly_.platform.deviceInfo());
}

HTTPRequest SBLNetworkRequestFactory::warmRequest(std::string_view url) {
  HTTPRequest request = build(url, [](Builder&) {});
  request.cachePolicy = HTTPCachePolicy::ignoreLocal;
  return proxiedIfEnabled(std::move(request));
}

HTTPRequest SBLNetworkRequestFactory::bagFetchRequest(const SableBagController& bagController,
                                                      std::string_view userAgent, std::string_view version,
                                                      RequestTrace* trace) {
  const std::string country = contextAccessQueue_->sync([this] { return context_.geoDeviceCountryCode; });
  const auto steps = [&](Builder& builder) {
    _addVersionQueryItem(builder, version);
    _addSecretKeyQueryItem(builder);
    _addDebugQueryItems(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addDeviceCountryCodeQueryItem(builder);
    _addHttpRequestUserAgent(builder, userAgent);
    _addBrambleQueryItem(builder);
  };
  HTTPRequest request = build(bagController.bagFetchURLWithCountry(country), steps, trace);
  request.cachePolicy = HTTPCachePolicy::ignoreLocal;
  return request;
}

HTTPRequest SBLNetworkRequestFactory::bagCacheRequest(const SableBagController& bagController,
                                                      std::string_view userAgent, std::string_view version) {
  const std::string country = contextAccessQueue_->sync([this] { return context_.geoDeviceCountryCode; });
  return build(bagController.bagFetchURLWithCountry(country), [&](Builder& builder) {
    _addVersionQueryItem(builder, version);
    _addDebugQueryItems(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addDeviceCountryCodeQueryItem(builder);
    _addAgentQueryItem(builder, userAgent);
    _addBrambleQueryItem(builder);
  });
}

std::optional<HTTPRequest> SBLNetworkRequestFactory::searchRequest(const SBLSearchRequest& input,
                                                                   const SBLBag& bag, const UUID& userGuid,
                                                                   unsigned fieldMask, RequestTrace* trace) {
  if (!bag.searchURL()) return std::nullopt;
  const bool withLocation = (fieldMask & kSBLFieldMaskNoLocation) == 0;
  const auto steps = [&](Builder& builder) {
    startUpdatingLocationFor(builder);
    builder.beginStep("query");
    builder.forceQueryItemWithName("q", input.queryString);
    constexpr std::int64_t kSuggestionTapped = 8, kSuggestionTyped = 10;
    if (input.triggerEvent == kSuggestionTapped || input.triggerEvent == kSuggestionTyped) {
      builder.forceQueryItemWithName("qtype", "suggested");
    }
    builder.beginStep("client's items");
    builder.forceQueryItemsFromArray(input.queryItems);
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addCardQueryItem(builder);
    _addHttpRequestTopTopics(builder, input);
    _addDeviceCountryCodeQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addKeyboardInputModeQueryItem(builder, input);
    _addCalendarQueryItem(builder);
    _addTimeZoneQueryItem(builder);
    _addTemperatureUnitsQueryItem(builder);
    _addTempUnitPreferenceQueryItem(builder);
    _add24hDateFormatQueryItem(builder);
    _addHttpGeoClientMetadata(builder);
    if (withLocation) {
      _addLocationQueryItem(builder);
      _addLocationSourceQueryItem(builder);
      _addHttpAppWhitelistSignature(builder);
    }
    _addManagedAccountQueryItem(builder);
    _addStoreFrontQueryItem(builder);
    _addHttpRequestSubscriptionInfo(builder);
    _addHttpRequestUserGuid(builder, userGuid);
    _addHttpRequestUserAgent(builder, bag.userAgent());
    _addHttpRequestUIScale(builder, input.scale);
    _addHttpMapsEnvironmentName(builder, bag);
    _addHttpRequestMapsSessionId(builder);
  };
  HTTPRequest request = build(*bag.searchURL(), steps, trace);
  request.timeout = bag.timeoutIntervalForRequest();
  return withLocation ? proxiedIfEnabled(std::move(request)) : std::move(request);
}

std::optional<HTTPRequest> SBLNetworkRequestFactory::zeroKeywordRequest(const SBLZeroKeywordRequest& input,
                                                                        const SBLBag& bag,
                                                                        const UUID& userGuid,
                                                                        unsigned fieldMask,
                                                                        RequestTrace* trace) {
  if (!bag.searchURL()) return std::nullopt;
  const auto steps = [&](Builder& builder) {
    startUpdatingLocationFor(builder);
    builder.beginStep("query");
    builder.forceQueryItemWithName("qtype", "zkw");
    builder.beginStep("client's items");
    builder.forceQueryItemsFromArray(input.queryItems);
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addKeyboardInputModeQueryItem(builder, input);
    _addCalendarQueryItem(builder);
    _addTimeZoneQueryItem(builder);
    _addTempUnitPreferenceQueryItem(builder);
    _addTemperatureUnitsQueryItem(builder);
    _add24hDateFormatQueryItem(builder);
    _addDeviceCountryCodeQueryItem(builder);
    _addHttpGeoClientMetadata(builder);
    if ((fieldMask & kSBLFieldMaskNoLocation) == 0) {
      _addLocationQueryItem(builder);
      _addLocationSourceQueryItem(builder);
    }
    _addStoreFrontQueryItem(builder);
    _addHttpRequestSubscriptionInfo(builder);
    _addManagedAccountQueryItem(builder);
    _addHttpRequestUserGuid(builder, userGuid);
    _addHttpRequestUserAgent(builder, bag.userAgent());
    _addHttpRequestUIScale(builder, input.scale);
    _addHttpMapsEnvironmentName(builder, bag);
    _addHttpRequestMapsSessionId(builder);
  };
  HTTPRequest request = build(*bag.searchURL(), steps, trace);
  request.timeout = bag.timeoutIntervalForRequest();
  return request;
}

HTTPRequest SBLNetworkRequestFactory::moreResultsRequest(const SBLMoreResultsRequest& input,
                                                         const SBLBag& bag, const UUID& userGuid,
                                                         unsigned fieldMask, RequestTrace* trace) {
  const bool withLocation = (fieldMask & kSBLFieldMaskNoLocation) == 0;
  const auto steps = [&](Builder& builder) {
    if (!builder.containsQueryItemWithName("latlng")) startUpdatingLocationFor(builder);
    builder.beginStep("client's items");
    builder.forceQueryItemsFromArray(input.queryItems);
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    if (withLocation) {
      _addLocationQueryItem(builder);
      _addLocationSourceQueryItem(builder);
      _addHttpAppWhitelistSignature(builder);
    }
    _addStoreFrontQueryItem(builder);
    _addHttpRequestSubscriptionInfo(builder);
    _addManagedAccountQueryItem(builder);
    _addHttpRequestUserGuid(builder, userGuid);
    _addHttpRequestUserAgent(builder, bag.userAgent());
    _addHttpRequestUIScale(builder, input.scale);
  };
  HTTPRequest request = build(input.moreResultsURL, steps, trace);
  request.timeout = bag.timeoutIntervalForRequest();
  return withLocation ? proxiedIfEnabled(std::move(request)) : request;
}

std::optional<HTTPRequest> SBLNetworkRequestFactory::lookupRequest(const SBLLookupRequest& input,
                                                                   const SBLBag& bag, const UUID& userGuid,
                                                                   RequestTrace* trace) {
  if (!bag.searchURL()) return std::nullopt;
  const auto steps = [&](Builder& builder) {
    startUpdatingLocationFor(builder);
    builder.beginStep("query");
    builder.forceQueryItemWithName("q", input.queryString);
    builder.beginStep("client's items");
    builder.forceQueryItemsFromArray(input.queryItems);
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addKeyboardInputModeQueryItem(builder, input);
    _addDeviceCountryCodeQueryItem(builder);
    _addHttpGeoClientMetadata(builder);
    _addLocationQueryItem(builder);
    _addLocationSourceQueryItem(builder);
    _addStoreFrontQueryItem(builder);
    _addHttpRequestSubscriptionInfo(builder);
    _addClientContextQueryItem(builder, input);
    _addLookupHintDomainQueryItem(builder, input);
    _addLookupSelectionType(builder, input);
    _addQueryLanguageQueryItem(builder, input);
    _addLookupContextLanguageQueryItem(builder, input);
    _addManagedAccountQueryItem(builder);
    _addHttpRequestUserGuid(builder, userGuid);
    _addHttpRequestUserAgent(builder, bag.userAgent());
    _addHttpRequestUIScale(builder, input.scale);
    _addHttpAppWhitelistSignature(builder);
    _addHttpRequestMapsSessionId(builder);
  };
  HTTPRequest request = build(*bag.searchURL(), steps, trace);
  request.timeout = bag.timeoutIntervalForRequest();
  return proxiedIfEnabled(std::move(request));
}

HTTPRequest SBLNetworkRequestFactory::cardRequest(const SBLCardRequest& input, const SBLBag& bag,
                                                  const UUID& userGuid, RequestTrace* trace) {
  const auto steps = [&](Builder& builder) {
    builder.beginStep("client's items");
    builder.forceQueryItemsFromArray(input.queryItems);
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addEffectiveSystemLanguageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addDeviceCountryCodeQueryItem(builder);
    _addLocationQueryItem(builder);
    _addLocationSourceQueryItem(builder);
    _addStoreFrontQueryItem(builder);
    _addHttpGeoClientMetadata(builder);
    _addHttpRequestUserGuid(builder, userGuid);
    _addHttpRequestUserAgent(builder, bag.userAgent());
    _addHttpRequestUIScale(builder, input.scale);
    _addHttpAppWhitelistSignature(builder);
    _addHttpRequestMapsSessionId(builder);
    _addHttpMapsEnvironmentName(builder, bag);
    _addHttpRequestSubscriptionInfo(builder);
  };
  HTTPRequest request = build(input.cardURL, steps, trace);
  request.timeout = bag.timeoutIntervalForRequest();
  return proxiedIfEnabled(std::move(request));
}

HTTPRequest SBLNetworkRequestFactory::fileDownloadRequest(std::string_view url, std::string_view version,
                                                          bool includeLatLong, RequestTrace* trace) {
  const auto steps = [&](Builder& builder) {
    _addSecretKeyQueryItem(builder);
    _addHttpRequestUserAgent(builder, createUserAgentString("Beacon/1"));
    if (includeLatLong) _addHttpFuzzedLocation(builder);
    _addHttpIfNoneMatch(builder, version);
  };
  return build(url, steps, trace);
}

HTTPRequest SBLNetworkRequestFactory::flusherUploadRequest(std::string_view url, double timeout,
                                                           std::string_view digest, RequestTrace* trace) {
  const auto steps = [&](Builder& builder) {
    _addDebugQueryItems(builder);
    _addSecretKeyQueryItem(builder);
    _addDeviceCountryCodeQueryItem(builder);
    _addLocaleQueryItem(builder);
    _addDiagnosticsAndUsageQueryItem(builder);
    _addHttpRequestPreferredLanguages(builder);
    _addHttpRequestUserAgent(builder, sabledUserAgent_);
  };
  HTTPRequest request = build(url, steps, trace);
  request.headers.set("X-Kestrel-Digest", std::string(digest));
  request.method = "POST";
  request.cachePolicy = HTTPCachePolicy::ignoreLocal;
  request.timeout = timeout;
  request.headers.set("Content-Encoding", "deflate");
  return request;
}

}  // namespace sable
