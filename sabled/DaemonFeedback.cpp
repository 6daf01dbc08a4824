#include "sabled/DaemonFeedback.h"

#include <simdjson.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "SableKit/messages/RKFeedback.pb.h"
#include "SableKit/messages/SKFeedback.pb.h"
#include "sabled/FeedbackOfKind.h"
#include "sabled/FeedbackTables.h"
#include "sabled/NetworkTimingTranslation.h"

namespace sable::feedback {

namespace {

/// A message of the class at a time.
template <class M>
M at(platform::MonotonicTime time) {
  M message;
  message.set_timestamp(static_cast<std::uint64_t>(time.time_since_epoch().count()));
  return message;
}

template <class Kind, class M>
Message made(std::string_view className, M message) {
  return std::make_unique<FeedbackOfKind<Kind, M>>(className, std::move(message));
}

/// Messages hold UTF-8 only, but a path or a header in an error need not be.
std::string text(std::string_view bytes) {
  if (simdjson::validate_utf8(bytes)) return std::string(bytes);
  return parseJSON(compactJSON(Dictionary(bytes)), std::numeric_limits<std::size_t>::max())
      ->get<std::string>();
}

std::uint32_t enumeration(std::int64_t value) {
  constexpr auto kNone = std::numeric_limits<std::uint32_t>::max();
  return std::in_range<std::uint32_t>(value) ? static_cast<std::uint32_t>(value) : kNone;
}

template <class M>
M networkSearchStart(platform::MonotonicTime time, const NetworkSearch& search) {
  M message = at<M>(time);
  message.set_trigger_event(enumeration(search.triggerEvent));
  message.set_input(text(search.input));
  message.set_uuid(std::string(search.uuid));
  message.set_url(text(search.request.url));
  message.set_endpoint_type(static_cast<std::uint32_t>(search.endpoint));
  for (const auto& [name, value] : search.request.headers.fields()) {
    auto& field = *message.add_headers();
    field.set_name(text(name));
    field.set_value(text(value));
  }
  return message;
}

messages::SBLNetworkTiming::Entry& add(messages::SBLNetworkTiming& timing, std::string_view name) {
  auto& entry = *timing.add_entries();
  entry.set_key(std::string(kTimingPrefix).append(name));
  return entry;
}

/// In the names of the clients' network library.
messages::SBLNetworkTiming networkTiming(const platform::HTTPTaskTiming& timing) {
  messages::SBLNetworkTiming message;
  const std::pair<std::string_view, platform::Duration> phases[] = {
      {"DomainLookupEnd", timing.nameLookup},
      {"ConnectEnd", timing.connect},
      {"SecureConnectionEnd", timing.secureConnect},
      {"RequestStart", timing.requestStart},
      {"ResponseStart", timing.responseStart},
      {"RedirectEnd", timing.redirect},
      {"ResponseEnd", timing.total}};
  add(message, "FetchStart").set_number(platform::secondsSince1970(timing.start));
  for (const auto& [name, offset] : phases) {
    if (offset.count() == 0) continue;  // did not happen
    add(message, name).set_number(platform::secondsSince1970(timing.start + offset));
  }
  add(message, kConnectionReused).set_flag(timing.reusedConnection);
  if (!timing.peerAddress.empty()) {
    add(message, kConnectionPeerAddress).set_data(peerAddressData(timing.peerAddress, timing.peerPort));
  }
  auto& counts = *add(message, kConnectionStopTimeCounts).mutable_statistics();
  add(counts, "NStatTxBytes").set_integer(timing.requestHeaderBytes + timing.requestBodyBytes);
  add(counts, "NStatRxBytes").set_integer(timing.responseHeaderBytes + timing.responseBodyBytes);
  return message;
}

template <class M>
M networkSearchEnd(platform::MonotonicTime time, const NetworkSearchEnd& end) {
  M message = at<M>(time);
  message.set_response_size(end.responseSize);
  message.set_status_code(end.statusCode);
  message.set_uuid(std::string(end.uuid));
  if (end.timing.start != platform::WallTime{}) *message.mutable_network_timing() = networkTiming(end.timing);
  return message;
}

void fill(messages::SBLErrorRecord& record, const Error& error) {
  record.set_code(error.code);
  if (!error.domain.empty()) record.set_domain(text(error.domain));
  if (!error.reason.empty()) record.set_reason(text(error.reason));
}

}  // namespace

std::string_view triggerEventEnumToString(std::uint32_t sessionEndReason) {
  return wordOf(kSessionEndReasons, sessionEndReason);
}

Message skipSearch(platform::MonotonicTime time, SkipSearchTrigger trigger, std::string_view input) {
  auto message = at<messages::SBLSkipSearchFeedback>(time);
  message.set_trigger_event(static_cast<std::uint32_t>(trigger));
  message.set_input(text(input));
  return made<SkipSearch>("SBLSkipSearchFeedback", std::move(message));
}

Message cacheHit(platform::MonotonicTime time, std::string_view input, std::string_view uuid) {
  auto message = at<messages::SBLCacheHitFeedback>(time);
  message.set_trigger_event(static_cast<std::uint32_t>(SkipSearchTrigger::cacheHit));
  message.set_input(text(input));
  message.set_uuid(std::string(uuid));
  return made<CacheHit>("SBLCacheHitFeedback", std::move(message));
}

Message startNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search) {
  return made<StartNetworkSearch>("RKStartNetworkSearchFeedback",
                                  networkSearchStart<messages::RKStartNetworkSearchFeedback>(time, search));
}

Message startLookupNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search,
                                 std::int64_t lookupSelectionType) {
  auto message = networkSearchStart<messages::SBLLookupStartNetworkSearchFeedback>(time, search);
  message.set_lookup_selection_type(enumeration(lookupSelectionType));
  return made<LookupStartNetworkSearch>("SBLLookupStartNetworkSearchFeedback", std::move(message));
}

NetworkSearchEnd endOf(const platform::HTTPResult& result, std::string_view uuid) {
  return {.uuid = uuid,
          .responseSize = result.data == nullptr ? 0 : static_cast<std::int64_t>(result.data->size()),
          .statusCode = result.response ? result.response->status : 0,
          .timing = result.timing};
}

Message endNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end) {
  return made<EndNetworkSearch>("RKEndNetworkSearchFeedback",
                                networkSearchEnd<messages::RKEndNetworkSearchFeedback>(time, end));
}

Message endSableNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end,
                              const SableAnswer& answer) {
  auto message = networkSearchEnd<messages::_SKSKEndNetworkSearchFeedback>(time, end);
  if (answer.status) message.set_sable_status(text(*answer.status));
  message.set_sable_duration(answer.duration);
  if (answer.fbq) message.set_fbq(text(*answer.fbq));
  if (answer.partialClientIP) message.set_sable_partial_client_ip(text(*answer.partialClientIP));
  return made<EndSableNetworkSearch>("_SKSKEndNetworkSearchFeedback", std::move(message));
}

Message error(platform::MonotonicTime time, const Error& error, const Error* underlying) {
  auto message = at<messages::RKErrorFeedback>(time);
  fill(*message.mutable_error(), error);
  if (underlying != nullptr) fill(*message.mutable_underlying_error(), *underlying);
  return made<ErrorFeedback>("RKErrorFeedback", std::move(message));
}

Message sessionEnd(platform::MonotonicTime time, SessionEndReason reason) {
  auto message = at<messages::SableSessionEndFeedback>(time);
  message.set_reason(static_cast<std::uint32_t>(reason));
  return made<SessionEnd>("SableSessionEndFeedback", std::move(message));
}

Message connectionInvalidated(platform::MonotonicTime time) {
  return made<ConnectionInvalidated>("SableConnectionInvalidated",
                                     at<messages::SableConnectionInvalidated>(time));
}

Message sessionMissingResults(platform::MonotonicTime time, const std::vector<std::string>& results) {
  auto message = at<messages::_SKSessionMissingResultsFeedback>(time);
  // A result of the other family has the same fields under the same numbers.
  for (const std::string& result : results) message.add_results()->ParseFromString(result);
  return made<SessionMissingResults>("_SKSessionMissingResultsFeedback", std::move(message));
}

Message sessionMissingSuggestions(platform::MonotonicTime time, const std::vector<std::string>& suggestions) {
  auto message = at<messages::SableSessionMissingSuggestions>(time);
  for (const std::string& suggestion : suggestions) message.add_suggestions()->ParseFromString(suggestion);
  return made<SessionMissingSuggestions>("SableSessionMissingSuggestions", std::move(message));
}

}  // namespace sable::feedback
