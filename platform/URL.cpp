#include "platform/URL.h"

#include <curl/curl.h>

#include <algorithm>
#include <memory>

namespace sable::platform {
namespace {

struct HandleDeleter {
  void operator()(CURLU* handle) const { curl_url_cleanup(handle); }
};
using Handle = std::unique_ptr<CURLU, HandleDeleter>;

bool isLetter(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}

bool isUnreserved(char c) {
  return isLetter(c) || (c >= '0' && c <= '9') || c == '-' || c == '.' || c == '_' || c == '~';
}

std::string lowercase(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(),
                 [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c; });
  return text;
}

// Paths stay as they are written: a service may give "." and ".." a meaning of its own.
Handle handleFor(const std::string& text) {
  Handle handle(curl_url());
  if (curl_url_set(handle.get(), CURLUPART_URL, text.c_str(), CURLU_NON_SUPPORT_SCHEME | CURLU_PATH_AS_IS) !=
      CURLUE_OK) {
    return nullptr;
  }
  return handle;
}

std::string part(CURLU* handle, CURLUPart which) {
  char* text = nullptr;
  if (curl_url_get(handle, which, &text, 0) != CURLUE_OK) return {};
  std::string result(text);
  curl_free(text);
  return result;
}

// libcurl forgives one or three slashes after the scheme, and a scheme that begins with a digit.
bool looksAbsolute(std::string_view text) {
  const auto colon = text.find(':');
  if (colon == 0 || colon == std::string_view::npos || !isLetter(text.front())) return false;
  return text.substr(colon).starts_with("://") && text.substr(colon + 3).find_first_not_of("/?#") == 0;
}

std::string encoded(std::string_view text) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string result;
  result.reserve(text.size());
  for (const char c : text) {
    if (isUnreserved(c)) {
      result += c;
    } else {
      const auto byte = static_cast<unsigned char>(c);
      result += '%';
      result += kDigits[byte >> 4];
      result += kDigits[byte & 15];
    }
  }
  return result;
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// A '%' that two hexadecimal digits do not follow stands for itself.
std::string decoded(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    const int high = text[i] == '%' && i + 2 < text.size() ? hexDigit(text[i + 1]) : -1;
    const int low = high >= 0 ? hexDigit(text[i + 2]) : -1;
    if (low < 0) {
      result += text[i];
    } else {
      result += static_cast<char>(high * 16 + low);
      i += 2;
    }
  }
  return result;
}

URLQueryItem itemFrom(std::string_view piece) {
  const auto equals = piece.find('=');
  if (equals == std::string_view::npos) return {decoded(piece), std::nullopt};
  return {decoded(piece.substr(0, equals)), decoded(piece.substr(equals + 1))};
}

}  // namespace

std::optional<URL> URL::parse(std::string_view text) {
  const auto isControl = [](char c) { return static_cast<unsigned char>(c) <= ' ' || c == '\x7f'; };
  if (!looksAbsolute(text) || std::any_of(text.begin(), text.end(), isControl)) return std::nullopt;
  std::string copy(text);
  const Handle handle = handleFor(copy);
  if (!handle || part(handle.get(), CURLUPART_HOST).empty()) return std::nullopt;
  return URL(std::move(copy));
}

std::optional<URL> URL::resolve(std::string_view reference) const {
  if (reference.empty()) return *this;
  const Handle handle = handleFor(text_);
  const std::string copy(reference);
  if (curl_url_set(handle.get(), CURLUPART_URL, copy.c_str(), CURLU_NON_SUPPORT_SCHEME) != CURLUE_OK) {
    return std::nullopt;
  }
  return parse(part(handle.get(), CURLUPART_URL));
}

std::string URL::scheme() const {
  return lowercase(text_.substr(0, text_.find(':')));
}

std::string URL::host() const {
  std::string host = lowercase(part(handleFor(text_).get(), CURLUPART_HOST));
  if (host.size() > 2 && host.front() == '[') return host.substr(1, host.size() - 2);
  return host;
}

std::string URL::path() const {
  return part(handleFor(text_).get(), CURLUPART_PATH);
}

std::vector<URLQueryItem> URL::queryItems() const {
  std::vector<URLQueryItem> items;
  const std::string query = part(handleFor(text_).get(), CURLUPART_QUERY);
  for (std::string_view rest = query; !rest.empty();) {
    const std::string_view piece = rest.substr(0, rest.find('&'));
    if (!piece.empty()) items.push_back(itemFrom(piece));
    rest.remove_prefix(std::min(rest.size(), piece.size() + 1));
  }
  return items;
}

void URL::setQueryItems(const std::vector<URLQueryItem>& items) {
  std::string query;
  for (const auto& [name, value] : items) {
    if (!query.empty()) query += '&';
    query += encoded(name);
    if (value) query += '=' + encoded(*value);
  }
  // Spliced into the text, because libcurl writes the digits of %2B in lower case.
  const std::size_t fragment = std::min(text_.find('#'), text_.size());
  const std::size_t start = std::min(text_.find('?'), fragment);
  text_.replace(start, fragment - start, query.empty() ? query : '?' + query);
}

}  // namespace sable::platform
