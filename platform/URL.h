#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace sable::platform {

/// A query item; the value is absent in "?name" and empty in "?name=".
struct URLQueryItem {
  std::string name;
  std::optional<std::string> value;

  friend bool operator==(const URLQueryItem&, const URLQueryItem&) = default;
};

/// An absolute URL with a host, taken apart (RFC 3986) by libcurl's URL interface; only the list of
/// query items is ours.
class URL {
 public:
  /// Reads an absolute URL; nullopt when it is none.
  static std::optional<URL> parse(std::string_view text);

  /// What a reference in a document at this URL means (RFC 3986 section 5.2): its Location, say.
  std::optional<URL> resolve(std::string_view reference) const;

  std::string scheme() const;  ///< lower case
  std::string host() const;    ///< lower case, without brackets
  std::string path() const;    ///< as it is written; "/" where there is none

  /// Items in order, percent-decoded.
  std::vector<URLQueryItem> queryItems() const;
  /// Replaces the query. All but unreserved characters (RFC 3986 section 2.3) is percent-encoded in
  /// names and values, so that '+', ';' and '&' inside a value arrive as themselves. No items: no
  /// query.
  void setQueryItems(const std::vector<URLQueryItem>& items);

  const std::string& string() const { return text_; }

 private:
  explicit URL(std::string text) : text_(std::move(text)) {}
  std::string text_;
};

}  // namespace sable::platform
