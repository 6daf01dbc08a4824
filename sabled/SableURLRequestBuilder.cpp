#include "sabled/SableURLRequestBuilder.h"

#include <utility>

namespace sable {

using platform::URLQueryItem;

std::optional<SableURLRequestBuilder> SableURLRequestBuilder::requestBuilderWithURL(std::string_view url) {
  auto parsed = platform::URL::parse(url);
  if (!parsed) return std::nullopt;
  return SableURLRequestBuilder(std::move(*parsed));
}

SableURLRequestBuilder::SableURLRequestBuilder(platform::URL url) : urlComponents_(std::move(url)) {
  forceQueryItemsFromArray(urlComponents_.queryItems());
}

bool SableURLRequestBuilder::containsQueryItemWithName(std::string_view name) const {
  return queryItems_.find(name) != queryItems_.end();
}

void SableURLRequestBuilder::forceQueryItem(URLQueryItem item) {
  std::string name = item.name;
  queryItems_.insert_or_assign(std::move(name), std::move(item));
}

void SableURLRequestBuilder::forceQueryItemWithName(std::string_view name, std::optional<std::string> value) {
  forceQueryItem({std::string(name), std::move(value)});
}

void SableURLRequestBuilder::forceQueryItemsFromArray(const std::vector<URLQueryItem>& items) {
  for (const URLQueryItem& item : items) forceQueryItem(item);
}

void SableURLRequestBuilder::defaultQueryItem(URLQueryItem item) {
  if (!containsQueryItemWithName(item.name)) forceQueryItem(std::move(item));
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
  if (value) {
    httpHeaders_.set(name, *value);
  } else {
    httpHeaders_.remove(name);
  }
}

void SableURLRequestBuilder::defaultHttpHeaderWithName(std::string_view name, std::string value) {
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
