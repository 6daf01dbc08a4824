#include "SableKit/SBLRelayCoding.h"

#include <algorithm>
#include <utility>

#include "platform/RelayValue.h"

namespace sable {
namespace {

using platform::HTTPHeaders;
using platform::RelayRecord;
using platform::RelayStringMap;
using platform::RelayStringPairs;

void add(RelayRecord& record, std::string_view name, const std::optional<std::string>& value) {
  if (value) record.add(std::string(name), *value);
}
void add(RelayRecord& record, std::string_view name, std::string value) {
  record.add(std::string(name), std::move(value));
}
void addUnlessZero(RelayRecord& record, std::string_view name, auto value) {
  if (value != decltype(value){}) record.add(std::string(name), value);
}

// One function per class says which members it has beyond the common ones; `Members` either writes
// them to a record or reads them from one.
template <class Members>
void visitMembers(SBLSearchRequest& request, Members& members) {
  members("queryString", request.queryString);
  members("topics", request.topics);
}
template <class Members>
void visitMembers(SBLMoreResultsRequest& request, Members& members) {
  members("moreResultsURL", request.moreResultsURL);
}
template <class Members>
void visitMembers(SBLCardRequest& request, Members& members) {
  members("cardURL", request.cardURL);
}
template <class Members>
void visitMembers(SBLZeroKeywordRequest&, Members&) {}
template <class Members>
void visitMembers(SBLLookupRequest& request, Members& members) {
  members("queryString", request.queryString);
  members("appBundleId", request.appBundleId);
  members("domain", request.domain);
  members("lookupSelectionType", request.lookupSelectionType);
  members("queryContext", request.queryContext);
}
template <class Members>
void visitMembers(SBLFlightLookupRequest& request, Members& members) {
  members("queryString", request.queryString);
}
template <class Members>
void visitMembers(SBLFlightSearchRequest& request, Members& members) {
  members("queryString", request.queryString);
}

struct Writer {
  RelayRecord& record;
  void operator()(std::string_view name, const std::string& value) { add(record, name, value); }
  void operator()(std::string_view name, const std::optional<std::string>& value) {
    add(record, name, value);
  }
  void operator()(std::string_view name, std::int64_t value) { addUnlessZero(record, name, value); }
};

struct Reader {
  const RelayRecord& record;
  void operator()(std::string_view name, std::string& value) { value = record.string(name).value_or(""); }
  void operator()(std::string_view name, std::optional<std::string>& value) { value = record.string(name); }
  void operator()(std::string_view name, std::int64_t& value) {
    value = record.signedInteger(name).value_or(0);
  }
};

void readCommonMembers(const RelayRecord& record, SBLRequest& request) {
  request.queryId = record.unsignedInteger("queryId").value_or(0);
  request.clientQueryId = record.unsignedInteger("clientQueryId").value_or(0);
  request.triggerEvent = record.signedInteger("triggerEvent").value_or(0);
  request.scale = record.number("scale").value_or(0);
  request.keyboardInputMode = record.string("keyboardInputMode");
  request.verboseReply = record.boolean("verboseReply").value_or(false);
  const auto* items = record.find("queryItems");
  if (items == nullptr) return;
  if (const auto* pairs = std::get_if<RelayStringPairs>(items)) {
    for (const auto& [name, value] : pairs->pairs) request.queryItems.push_back({name, value});
  }
}

template <std::size_t Index = 0>
std::optional<SBLAnyRequest> decodeAs(std::string_view className, const RelayRecord& record) {
  if constexpr (Index == std::variant_size_v<SBLAnyRequest>) {
    return std::nullopt;
  } else {
    using Request = std::variant_alternative_t<Index, SBLAnyRequest>;
    if (className != Request::kClassName) return decodeAs<Index + 1>(className, record);
    Request request;
    readCommonMembers(record, request);
    Reader reader{record};
    visitMembers(request, reader);
    return request;
  }
}

RelayStringMap encodeHeaders(const HTTPHeaders& headers) {
  // A D-Bus dictionary has each key once: fields of one name are joined (RFC 9110 section 5.3).
  RelayStringMap map;
  for (const auto& field : headers.fields()) {
    const auto found =
        std::ranges::find(map.entries, field.first, [](const auto& entry) { return entry.first; });
    if (found == map.entries.end()) {
      map.entries.push_back(field);
    } else {
      found->second.append(", ").append(field.second);
    }
  }
  return map;
}

HTTPHeaders decodeHeaders(const RelayRecord& record) {
  HTTPHeaders headers;
  const auto* member = record.find("headers");
  if (member == nullptr) return headers;
  if (const auto* map = std::get_if<RelayStringMap>(member)) {
    for (const auto& [name, value] : map->entries) headers.add(name, value);
  }
  return headers;
}

const RelayRecord* recordMember(const RelayRecord& record, std::string_view name) {
  const auto* member = record.find(name);
  return member == nullptr ? nullptr : std::get_if<RelayRecord>(member);
}

}  // namespace

RelayRecord encodeConfiguration(const SBLSessionConfiguration& configuration) {
  RelayRecord record;
  add(record, "identifier", configuration.identifier);
  add(record, "userAgent", configuration.userAgent);
  return record;
}

SBLSessionConfiguration decodeConfiguration(const RelayRecord& record) {
  return {record.string("identifier"), record.string("userAgent")};
}

std::string_view requestClassName(const SBLAnyRequest& request) {
  return std::visit([](const auto& one) { return one.kClassName; }, request);
}

RelayRecord encodeRequest(const SBLAnyRequest& request) {
  RelayRecord record;
  const auto& common = std::visit([](const auto& one) -> const SBLRequest& { return one; }, request);
  addUnlessZero(record, "queryId", common.queryId);
  addUnlessZero(record, "clientQueryId", common.clientQueryId);
  addUnlessZero(record, "triggerEvent", common.triggerEvent);
  addUnlessZero(record, "scale", common.scale);
  add(record, "keyboardInputMode", common.keyboardInputMode);
  addUnlessZero(record, "verboseReply", common.verboseReply);
  if (!common.queryItems.empty()) {
    RelayStringPairs pairs;
    for (const auto& item : common.queryItems) pairs.pairs.emplace_back(item.name, item.value.value_or(""));
    record.add("queryItems", std::move(pairs));
  }
  std::visit(
      [&](auto copy) {
        Writer writer{record};
        visitMembers(copy, writer);
      },
      request);
  return record;
}

std::optional<SBLAnyRequest> decodeRequest(std::string_view className, const RelayRecord& record) {
  return decodeAs(className, record);
}

platform::RelayRecords encodeImageDescriptions(const std::vector<SBLImageDescription>& descriptions) {
  platform::RelayRecords records;
  for (const SBLImageDescription& description : descriptions) {
    RelayRecord& record = records.emplace_back();
    add(record, "url", description.url);
    add(record, "id", description.id);
  }
  return records;
}

std::vector<SBLImageDescription> decodeImageDescriptions(const platform::RelayRecords& records) {
  std::vector<SBLImageDescription> descriptions;
  for (const RelayRecord& record : records) {
    descriptions.push_back({record.string("url"), record.string("id")});
  }
  return descriptions;
}

RelayRecord encodeError(const std::optional<Error>& error) {
  RelayRecord record;
  if (!error) return record;
  record.add("domain", error->domain);
  record.add("code", error->code);
  record.add("reason", error->reason);
  return record;
}

std::optional<Error> decodeError(const RelayRecord& record) {
  if (record.empty()) return std::nullopt;
  return Error{record.string("domain").value_or(""), record.signedInteger("code").value_or(0),
               record.string("reason").value_or("")};
}

RelayRecord encodeReply(const std::optional<SBLReply>& reply) {
  RelayRecord record;
  if (!reply) return record;
  record.add("scale", reply->scale);
  if (reply->data != nullptr) record.add("data", reply->data);
  add(record, "geoSessionEntityString", reply->geoSessionEntityString);
  if (reply->httpRequest) {
    RelayRecord request;
    request.add("url", reply->httpRequest->url);
    request.add("method", reply->httpRequest->method);
    request.add("headers", encodeHeaders(reply->httpRequest->headers));
    record.add("httpRequest", std::move(request));
  }
  if (reply->httpResponse) {
    RelayRecord response;
    response.add("url", reply->httpResponse->url);
    response.add("status", std::int64_t{reply->httpResponse->status});
    response.add("headers", encodeHeaders(reply->httpResponse->headers));
    record.add("httpResponse", std::move(response));
  }
  return record;
}

std::optional<SBLReply> decodeReply(const RelayRecord& record) {
  if (record.empty()) return std::nullopt;
  SBLReply reply;
  reply.scale = record.number("scale").value_or(0);
  if (const auto* member = record.find("data")) {
    if (const auto* data = std::get_if<Data>(member)) reply.data = *data;
  }
  reply.geoSessionEntityString = record.string("geoSessionEntityString");
  if (const RelayRecord* request = recordMember(record, "httpRequest")) {
    reply.httpRequest.emplace();
    reply.httpRequest->url = request->string("url").value_or("");
    reply.httpRequest->method = request->string("method").value_or("");
    reply.httpRequest->headers = decodeHeaders(*request);
  }
  if (const RelayRecord* response = recordMember(record, "httpResponse")) {
    reply.httpResponse.emplace();
    reply.httpResponse->url = response->string("url").value_or("");
    reply.httpResponse->status = static_cast<int>(response->signedInteger("status").value_or(0));
    reply.httpResponse->headers = decodeHeaders(*response);
  }
  return reply;
}

}  // namespace sable
