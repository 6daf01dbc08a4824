#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/HTTPSession.h"
#include "platform/URL.h"

namespace sable {

class RequestTrace;

/// Collects the query items and headers of one request. "Force" sets one and replaces what was
/// there; "default" sets it only where nothing of that name is: so the order of calls decides what
/// wins, while on the wire the items always stand in the order of their names. One thread at a
/// time.
class SableURLRequestBuilder {
 public:
  /// Starts from a URL, whose own query items count as forced: of two with one name the later one
  /// stays. nullopt when `url` is no absolute URL. A `trace`, which must outlive the builder, is told
  /// of everything that is added.
  static std::optional<SableURLRequestBuilder> requestBuilderWithURL(std::string_view url,
                                                                     RequestTrace* trace = nullptr);

  /// Names the step that what is added next belongs to, for the trace.
  void beginStep(std::string_view step);
  bool isTraced() const { return trace_ != nullptr; }

  bool containsQueryItemWithName(std::string_view name) const;
  void forceQueryItem(platform::URLQueryItem item);
  void forceQueryItemWithName(std::string_view name, std::optional<std::string> value);
  void forceQueryItemsFromArray(const std::vector<platform::URLQueryItem>& items);
  void defaultQueryItem(const platform::URLQueryItem& item);
  void defaultQueryItemWithName(std::string_view name, std::optional<std::string> value);

  bool containsHttpHeaderWithName(std::string_view name) const;
  /// nullopt removes the header.
  void forceHttpHeaderWithName(std::string_view name, const std::optional<std::string>& value);
  void defaultHttpHeaderWithName(std::string_view name, std::string value);

  /// The finished request: query items sorted by name, every ';' of the query as "%3B".
  platform::HTTPRequest createMutableUrlRequest() const;

 private:
  SableURLRequestBuilder(platform::URL url, RequestTrace* trace);

  std::optional<std::string> queryItemValue(std::string_view name) const;
  std::optional<std::string> headerValue(std::string_view name) const;

  platform::URL urlComponents_;
  RequestTrace* trace_;
  std::map<std::string, platform::URLQueryItem, std::less<>> queryItems_;
  platform::HTTPHeaders httpHeaders_;
};

}  // namespace sable
