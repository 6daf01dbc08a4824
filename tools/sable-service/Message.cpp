#include "Message.h"

#include <fmt/format.h>
#include <zlib.h>

#include <algorithm>
#include <cctype>

namespace service {

namespace {

char lower(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  c = lower(c);
  return c >= 'a' && c <= 'f' ? c - 'a' + 10 : -1;
}

bool isUnreserved(char c) {
  return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '-' || c == '.' || c == '_' || c == '~';
}

bool namesTag(std::string_view condition, const std::string& tag) {
  return condition == "*" || condition.find(tag) != std::string_view::npos;
}

}  // namespace

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return std::ranges::equal(a, b, {}, lower, lower);
}

std::string lowercase(std::string_view text) {
  std::string result(text);
  std::ranges::transform(result, result.begin(), lower);
  return result;
}

std::string toText(const Json& document) {
  return document.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::optional<std::string> Request::item(std::string_view name) const {
  const auto found = std::ranges::find(items, name, &Pairs::value_type::first);
  return found == items.end() ? std::nullopt : std::optional(found->second);
}

std::optional<std::string> Request::header(std::string_view name) const {
  const auto found =
      std::ranges::find_if(headers, [&](auto& h) { return equalsIgnoringCase(h.first, name); });
  return found == headers.end() ? std::nullopt : std::optional(found->second);
}

Answer Answer::json(const Json& document, int status) {
  Answer answer;
  answer.status = status;
  answer.body = toText(document);
  return answer;
}

Answer Answer::empty(int status) {
  Answer answer;
  answer.status = status;
  return answer;
}

Answer Answer::error(int status, const std::string& reason) {
  return json({{"status", status}, {"reason", reason}}, status);
}

Answer Answer::tagged(const Request& request, std::string type, std::string body,
                      const std::string& cacheControl) {
  const auto sum = crc32_z(0, reinterpret_cast<const Bytef*>(body.data()), body.size());
  const std::string tag = fmt::format("\"{:08x}-{:x}\"", sum, body.size());
  Answer answer;
  answer.headers = {{"ETag", tag}, {"Cache-Control", cacheControl}};
  if (namesTag(request.header("If-None-Match").value_or(""), tag)) {
    answer.status = 304;
    return answer;
  }
  answer.type = std::move(type);
  answer.body = std::move(body);
  return answer;
}

std::string percentDecode(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '%' && i + 2 < text.size() && hexValue(text[i + 1]) >= 0 && hexValue(text[i + 2]) >= 0) {
      result += static_cast<char>(hexValue(text[i + 1]) * 16 + hexValue(text[i + 2]));
      i += 2;
    } else {
      result += text[i];
    }
  }
  return result;
}

std::string percentEncode(std::string_view text) {
  std::string result;
  for (const char c : text) {
    if (isUnreserved(c))
      result += c;
    else
      result += fmt::format("%{:02X}", static_cast<unsigned char>(c));
  }
  return result;
}

void readTarget(Request& request) {
  std::string_view target = request.target;
  if (const auto authority = target.find("://"); !target.starts_with('/') && authority != target.npos) {
    const auto path = target.find('/', authority + 3);
    target = path == target.npos ? "/" : target.substr(path);
  }
  const auto mark = target.find('?');
  request.path = percentDecode(target.substr(0, mark));
  request.query = mark == target.npos ? "" : target.substr(mark + 1);
  std::string_view rest = request.query;
  while (!rest.empty()) {
    const std::string_view item = rest.substr(0, rest.find('&'));
    rest.remove_prefix(std::min(rest.size(), item.size() + 1));
    if (item.empty()) continue;
    const auto equals = std::min(item.find('='), item.size());
    request.items.emplace_back(percentDecode(item.substr(0, equals)),
                               percentDecode(item.substr(std::min(item.size(), equals + 1))));
  }
}

}  // namespace service
