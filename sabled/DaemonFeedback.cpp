#include "sabled/DaemonFeedback.h"

#include <limits>
#include <nlohmann/json.hpp>

#include "SableKit/messages/RKFeedback.pb.h"
#include "SableKit/messages/SKFeedback.pb.h"
#include "platform/ProgrammingError.h"
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

/// The road of a client's message: both come to be records in the same way.
template <class M>
Message made(const M& message) {
  const std::string name = message.GetTypeName();
  auto read =
      FeedbackMessage::parse(std::string_view(name).substr(name.rfind('.') + 1), message.SerializeAsString());
  if (!read) platform::programmingError(read.error().reason);
  return std::move(*read);
}

/// Messages hold UTF-8 only, but a path or a header in an error need not be.
std::string text(std::string_view bytes) {
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
  message.set_uuid(search.uuid);
  message.set_url(text(search.url));
  message.set_endpoint_type(static_cast<std::uint32_t>(search.endpoint));
  for (const auto& [name, value] : search.headers.fields()) {
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
  message.set_uuid(end.uuid);
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
  return made(message);
}

Message cacheHit(platform::MonotonicTime time, std::string_view input, std::string_view uuid) {
  auto message = at<messages::SBLCacheHitFeedback>(time);
  message.set_trigger_event(static_cast<std::uint32_t>(SkipSearchTrigger::cacheHit));
  message.set_input(text(input));
  message.set_uuid(std::string(uuid));
  return made(message);
}

Message startNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search) {
  return made(networkSearchStart<messages::RKStartNetworkSearchFeedback>(time, search));
}

Message startLookupNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search,
                                 std::int64_t lookupSelectionType) {
  auto message = networkSearchStart<messages::SBLLookupStartNetworkSearchFeedback>(time, search);
  message.set_lookup_selection_type(enumeration(lookupSelectionType));
  return made(message);
}

Message endNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end) {
  return made(networkSearchEnd<messages::RKEndNetworkSearchFeedback>(time, end));
}

Message endSableNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end,
                              const SableAnswer& answer) {
  auto message = networkSearchEnd<messages::_SKSKEndNetworkSearchFeedback>(time, end);
  if (answer.status) message.set_sable_status(text(*answer.status));
  message.set_sable_duration(answer.duration);
  if (answer.fbq) message.set_fbq(text(*answer.fbq));
  if (answer.partialClientIP) message.set_sable_partial_client_ip(text(*answer.partialClientIP));
  return made(message);
}

Message error(platform::MonotonicTime time, const Error& error, const Error* underlying) {
  auto message = at<messages::RKErrorFeedback>(time);
  fill(*message.mutable_error(), error);
  if (underlying != nullptr) fill(*message.mutable_underlying_error(), *underlying);
  return made(message);
}

Message sessionEnd(platform::MonotonicTime time, SessionEndReason reason) {
  auto message = at<messages::SableSessionEndFeedback>(time);
  message.set_reason(static_cast<std::uint32_t>(reason));
  return made(message);
}

Message connectionInvalidated(platform::MonotonicTime time) {
  return made(at<messages::SableConnectionInvalidated>(time));
}

Message sessionMissingResults(platform::MonotonicTime time, const std::vector<std::string>& results) {
  auto message = at<messages::_SKSessionMissingResultsFeedback>(time);
  // A result of the other family has the same fields under the same numbers.
  for (const std::string& result : results) message.add_results()->ParseFromString(result);
  return made(message);
}

Message sessionMissingSuggestions(platform::MonotonicTime time, const std::vector<std::string>& suggestions) {
  auto message = at<messages::SableSessionMissingSuggestions>(time);
  for (const std::string& suggestion : suggestions) message.add_suggestions()->ParseFromString(suggestion);
  return made(message);
}

}  // namespace sable::feedback
