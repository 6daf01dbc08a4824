#include "sabled/SableURLRequestBuilder.h"

#include <utility>

#include "sabled/RequestTrace.h"

namespace sable {

using platform::URLQueryItem;
using Place = RequestTrace::Place;

std::optional<SableURLRequestBuilder> SableURLRequestBuilder::requestBuilderWithURL(std::string_view url,
                                                                                    RequestTrace* trace) {
  auto parsed = platform::URL::parse(url);
  if (!parsed) return std::nullopt;
  return SableURLRequestBuilder(std::move(*parsed), trace);
}

SableURLRequestBuilder::SableURLRequestBuilder(platform::URL url, RequestTrace* trace)
    : urlComponents_(std::move(url)), trace_(trace) {
  beginStep("URL");
  forceQueryItemsFromArray(urlComponents_.queryItems());
}

void SableURLRequestBuilder::beginStep(std::string_view step) {
  if (trace_ != nullptr) trace_->beginStep(step);
}

bool SableURLRequestBuilder::containsQueryItemWithName(std::string_view name) const {
  return queryItems_.find(name) != queryItems_.end();
}

std::optional<std::string> SableURLRequestBuilder::queryItemValue(std::string_view name) const {
  const auto found = queryItems_.find(name);
  return found == queryItems_.end() ? std::nullopt : std::optional(found->second.value.value_or(""));
}

std::optional<std::string> SableURLRequestBuilder::headerValue(std::string_view name) const {
  const std::string* found = httpHeaders_.find(name);
  return found == nullptr ? std::nullopt : std::optional(*found);
}

void SableURLRequestBuilder::forceQueryItem(URLQueryItem item) {
  if (trace_ != nullptr) {
    trace_->noteForced(Place::queryItem, item.name, item.value.value_or(""), queryItemValue(item.name));
  }
  std::string name = item.name;
  queryItems_.insert_or_assign(std::move(name), std::move(item));
}

void SableURLRequestBuilder::forceQueryItemWithName(std::string_view name, std::optional<std::string> value) {
  forceQueryItem({std::string(name), std::move(value)});
}

void SableURLRequestBuilder::forceQueryItemsFromArray(const std::vector<URLQueryItem>& items) {
  for (const URLQueryItem& item : items) forceQueryItem(item);
}

void SableURLRequestBuilder::defaultQueryItem(const URLQueryItem& item) {
  if (trace_ != nullptr) {
    trace_->noteDefault(Place::queryItem, item.name, item.value.value_or(""), queryItemValue(item.name));
  }
  queryItems_.try_emplace(item.name, item);
}

void SableURLRequestBuilder::defaultQueryItemWithName(std::string_view name,
                                                      std::optional<std::string> value) {
  defaultQueryItem({std::string(name), std::move(value)});
}

bool SableURLRequestBuilder::containsHttpHeaderWithName(std::string_view name) const {
  return httpHeaders_.find(name) != nullptr;
}

void SableURLRequestBuilder::forceHttpHeaderWithName(std::string_view name,
                                                     const std::optional<std::string>& value) {
  if (trace_ != nullptr) {
    trace_->noteForced(Place::header, name, value.value_or(""), headerValue(name));
  }
  if (value) {
    httpHeaders_.set(name, *value);
  } else {
    httpHeaders_.remove(name);
  }
}

void SableURLRequestBuilder::defaultHttpHeaderWithName(std::string_view name, std::string value) {
  if (trace_ != nullptr) trace_->noteDefault(Place::header, name, value, headerValue(name));
  if (!containsHttpHeaderWithName(name)) httpHeaders_.add(std::string(name), std::move(value));
}

platform::HTTPRequest SableURLRequestBuilder::createMutableUrlRequest() const {
  std::vector<URLQueryItem> sorted;
  sorted.reserve(queryItems_.size());
  for (const auto& [name, item] : queryItems_) sorted.push_back(item);
  platform::URL url = urlComponents_;
  // Writing the items encodes everything but unreserved characters, ';' (as "%3B") among them.
  url.setQueryItems(sorted);

  platform::HTTPRequest request;
  request.url = url.string();
  request.headers = httpHeaders_;
  return request;
}

}  // namespace sable
