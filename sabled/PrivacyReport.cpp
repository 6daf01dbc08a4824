#include "sabled/PrivacyReport.h"

#include <algorithm>
#include <map>
#include <nlohmann/json.hpp>

#include "SableKit/SBLBag.h"
#include "platform/Dictionary.h"
#include "sabled/PrivacyTopics.h"
#include "sabled/SableUserGUIDController.h"

namespace sable {
namespace {

/// One value, and the requests that carry it.
struct Value {
  RequestTrace::Entry entry;
  std::vector<std::string> requests;

  bool isOf(const RequestTrace::Entry& other) const {
    return entry.place == other.place && entry.name == other.name && entry.value == other.value;
  }
};

/// What the request carries in the end: the last that was set under each name.
std::vector<RequestTrace::Entry> carried(const RequestTrace& trace) {
  std::vector<RequestTrace::Entry> entries;
  for (const RequestTrace::Entry& entry : trace.entries()) {
    if (entry.effect == RequestTrace::Effect::kept) continue;
    std::erase_if(entries, [&](const auto& earlier) {
      return earlier.place == entry.place && earlier.name == entry.name;
    });
    entries.push_back(entry);
  }
  return entries;
}

std::vector<Value> valuesOf(const std::vector<PrivacyReport::Request>& requests) {
  std::vector<Value> values;
  for (const PrivacyReport::Request& request : requests) {
    for (RequestTrace::Entry& entry : carried(request.trace)) {
      if (privacyTopic(entry.step).what.empty()) continue;
      const auto known = std::ranges::find_if(values, [&](const Value& value) { return value.isOf(entry); });
      if (known != values.end()) {
        known->requests.push_back(request.name);
      } else {
        values.push_back({std::move(entry), {request.name}});
      }
    }
  }
  std::ranges::stable_sort(values, {},
                           [](const Value& value) { return privacyTopic(value.entry.step).order; });
  return values;
}

Dictionary topicDocument(const PrivacyTopic& topic) {
  return {{"what", topic.what}, {"why", topic.why}, {"control", topic.control}};
}

Dictionary valuesDocument(const std::vector<Value>& values) {
  Dictionary rows = Dictionary::array();
  for (const Value& value : values) {
    Dictionary row = topicDocument(privacyTopic(value.entry.step));
    row["value"] = value.entry.value;
    row["place"] = value.entry.place == RequestTrace::Place::header ? "header" : "query item";
    row["name"] = value.entry.name;
    row["requests"] = value.requests;
    rows.push_back(std::move(row));
  }
  return rows;
}

/// What requests have a step for, without anything to tell now.
Dictionary unsentDocument(const std::vector<PrivacyReport::Request>& requests) {
  std::map<std::pair<std::size_t, std::string>, Dictionary> topics;  // by order and step
  for (const PrivacyReport::Request& request : requests) {
    for (const std::string& step : request.trace.silentSteps()) {
      const PrivacyTopic topic = privacyTopic(step);
      if (!topic.what.empty()) topics.try_emplace({topic.order, step}, topicDocument(topic));
    }
  }
  Dictionary rows = Dictionary::array();
  for (auto& [place, topic] : topics) rows.push_back(std::move(topic));
  return rows;
}

Dictionary requestsDocument(const PrivacyReport& report) {
  Dictionary rows = Dictionary::array();
  for (const PrivacyReport::Request& request : report.requests) {
    rows.push_back({{"request", request.name}, {"sent", true}, {"through_proxy", request.throughProxy}});
  }
  for (const PrivacyReport::Unasked& request : report.unasked) {
    rows.push_back({{"request", request.name}, {"sent", false}, {"why", request.why}});
  }
  return rows;
}

Dictionary bagDocument(const SBLBag* bag) {
  if (bag == nullptr) return nullptr;
  return {{"version", bag->version()},
          {"enabled", bag->isEnabled()},
          {"feedback_enabled", bag->feedbackEnabled()}};
}

}  // namespace

std::string PrivacyReport::json() const {
  const double lifetime = platform::toSeconds(kSBLUserGUIDLifetime);
  return compactJSON({{"agent", userAgent},
                      {"bag", bagDocument(bag.get())},
                      {"requests", requestsDocument(*this)},
                      {"values", valuesDocument(valuesOf(requests))},
                      {"not_sent", unsentDocument(requests)},
                      {"user_guid",
                       {{"value", userGuid.string()},
                        {"age", lifetime - userGuidRotatesIn},
                        {"rotates_in", userGuidRotatesIn}}},
                      {"signed_applications", signedApplications},
                      {"diagnostics_allowed", diagnosticsAllowed}});
}

}  // namespace sable
