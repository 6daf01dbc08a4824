#include "platform/HTTPSession.h"

#include <algorithm>

#include "platform/URL.h"

namespace sable::platform {
namespace {

char lower(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c;
}

bool sameName(std::string_view a, std::string_view b) {
  return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                    [](char x, char y) { return lower(x) == lower(y); });
}

auto isNamed(std::string_view name) {
  return [name](const auto& field) { return sameName(field.first, name); };
}

// RFC 9110 section 5.6.2.
bool isToken(std::string_view text) {
  static constexpr std::string_view kTokenCharacters =
      "!#$%&'*+-.^_`|~0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";
  return !text.empty() && text.find_first_not_of(kTokenCharacters) == std::string_view::npos;
}

}  // namespace

const std::string* HTTPHeaders::find(std::string_view name) const {
  const auto found = std::find_if(fields_.begin(), fields_.end(), isNamed(name));
  return found == fields_.end() ? nullptr : &found->second;
}

void HTTPHeaders::set(std::string_view name, std::string value) {
  const auto first = std::find_if(fields_.begin(), fields_.end(), isNamed(name));
  if (first == fields_.end()) return add(std::string(name), std::move(value));
  first->second = std::move(value);
  fields_.erase(std::remove_if(first + 1, fields_.end(), isNamed(name)), fields_.end());
}

void HTTPHeaders::remove(std::string_view name) {
  std::erase_if(fields_, isNamed(name));
}

std::string HTTPHeaders::description() const {
  std::string text = "{";
  for (const auto& [name, value] : fields_) {
    if (text.size() > 1) text += ", ";
    text += name + ": " + value;
  }
  return text + '}';
}

std::string HTTPResponse::description() const {
  return std::to_string(status) + ' ' + url + ' ' + headers.description();
}

Error httpError(HTTPErrorCode code, std::string reason) {
  return {std::string(kHTTPErrorDomain), static_cast<std::int64_t>(code), std::move(reason)};
}

std::optional<Error> invalidity(const HTTPRequest& request) {
  using namespace std::string_view_literals;
  const auto url = URL::parse(request.url);
  if (!url) return httpError(HTTPErrorCode::badURL, "not an absolute URL");
  const std::string scheme = url->scheme();
  if (scheme != "http" && scheme != "https") {
    return httpError(HTTPErrorCode::notAllowed, "scheme " + scheme + " is not http or https");
  }
  if (!isToken(request.method)) return httpError(HTTPErrorCode::other, "method is not a token");
  for (const auto& [name, value] : request.headers.fields()) {
    if (!isToken(name)) return httpError(HTTPErrorCode::other, "header name is not a token");
    if (value.find_first_of("\r\n\0"sv) != std::string::npos) {
      return httpError(HTTPErrorCode::other, "header " + name + " has a line break or NUL in its value");
    }
  }
  return std::nullopt;
}

bool isProxyURL(std::string_view text) {
  const auto url = URL::parse(text);
  const std::string scheme = url ? url->scheme() : "";
  return scheme == "http" || scheme == "https" || scheme == "socks5h";
}

}  // namespace sable::platform
