#include "platform/host/CacheRules.h"

#include <curl/curl.h>
#include <strings.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <string_view>

namespace sable::platform::host {
namespace {

using std::chrono::seconds;

// Ages beyond this mean "for ever" (section 1.2.2).
constexpr std::int64_t kMaximumDeltaSeconds = 2147483648;

constexpr std::array<std::string_view, 6> kConditions{"If-None-Match",       "If-Modified-Since", "If-Match",
                                                      "If-Unmodified-Since", "If-Range",          "Range"};

// Fields of a 304 that describe that message, not the stored one.
constexpr std::array<std::string_view, 10> kOfTheMessage{
    "Content-Length", "Content-Encoding", "Content-Range",    "Content-Type", "Transfer-Encoding",
    "Connection",     "Keep-Alive",       "Proxy-Connection", "Trailer",      "Upgrade"};

bool sameName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

template <std::size_t N>
bool isAmong(std::string_view name, const std::array<std::string_view, N>& names) {
  return std::any_of(names.begin(), names.end(), [&](std::string_view each) { return sameName(each, name); });
}

std::string_view trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(" \t");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t") - first + 1);
}

// A list that is spread over several fields means the same as one field (RFC 9110 section 5.3).
std::string combined(const HTTPHeaders& headers, std::string_view name) {
  std::string result;
  for (const auto& [field, value] : headers.fields()) {
    if (!sameName(field, name)) continue;
    if (!result.empty()) result += ", ";
    result += trimmed(value);
  }
  return result;
}

// Calls `each` with every member of a comma-separated list; commas in quoted strings do not count.
template <class Each>
void forEachMember(std::string_view list, Each each) {
  while (!list.empty()) {
    bool quoted = false;
    std::size_t end = 0;
    for (; end < list.size() && (quoted || list[end] != ','); ++end) {
      if (list[end] == '"') quoted = !quoted;
      if (quoted && list[end] == '\\') ++end;
    }
    end = std::min(end, list.size());
    if (const auto member = trimmed(list.substr(0, end)); !member.empty()) each(member);
    list.remove_prefix(std::min(end + 1, list.size()));
  }
}

std::optional<seconds> deltaSeconds(std::string_view text) {
  if (text.size() >= 2 && text.front() == '"' && text.back() == '"') text = text.substr(1, text.size() - 2);
  std::int64_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || text.front() == '-' || end != text.data() + text.size()) return std::nullopt;
  if (error == std::errc::result_out_of_range) return seconds(kMaximumDeltaSeconds);
  return seconds(std::min(value, kMaximumDeltaSeconds));
}

struct Directives {
  bool noStore = false, noCache = false;
  std::optional<seconds> maximumAge, minimumFreshness;
};

Directives directives(const HTTPHeaders& headers) {
  Directives result;
  const std::string control = combined(headers, "Cache-Control");
  forEachMember(control, [&](std::string_view member) {
    const auto equals = std::min(member.find('='), member.size());
    const auto name = trimmed(member.substr(0, equals));
    // A malformed or contradictory number counts as the strictest.
    const auto number = [&] {
      return deltaSeconds(trimmed(member.substr(std::min(equals + 1, member.size())))).value_or(seconds(0));
    };
    if (sameName(name, "no-store")) result.noStore = true;
    if (sameName(name, "no-cache")) result.noCache = true;
    if (sameName(name, "max-age"))
      result.maximumAge = std::min(result.maximumAge.value_or(number()), number());
    if (sameName(name, "min-fresh")) result.minimumFreshness = number();
  });
  if (control.empty() && sameName(combined(headers, "Pragma"), "no-cache")) result.noCache = true;
  return result;
}

std::optional<WallTime> date(const HTTPHeaders& headers, std::string_view name) {
  const std::string* text = headers.find(name);
  if (text == nullptr || text->find(' ') == std::string::npos) return std::nullopt;
  const time_t time = curl_getdate(text->c_str(), nullptr);
  if (time < 0) return std::nullopt;
  return WallTime(seconds(time));
}

Duration freshnessLifetime(const HTTPHeaders& headers, WallTime responseTime) {
  if (const auto age = directives(headers).maximumAge) return *age;
  if (headers.find("Expires") == nullptr) return {};
  const auto expires = date(headers, "Expires");
  if (!expires) return {};
  return std::max(*expires - date(headers, "Date").value_or(responseTime), Duration{});
}

bool hasValidator(const HTTPHeaders& headers) {
  return headers.find("ETag") != nullptr || headers.find("Last-Modified") != nullptr;
}

bool variesByEverything(const HTTPHeaders& headers) {
  bool result = false;
  const std::string vary = combined(headers, "Vary");
  forEachMember(vary, [&](std::string_view name) { result = result || name == "*"; });
  return result;
}

bool matches(const HTTPHeaders& varied, const HTTPHeaders& request) {
  return std::all_of(varied.fields().begin(), varied.fields().end(),
                     [&](const auto& field) { return combined(request, field.first) == field.second; });
}

}  // namespace

bool isCacheable(const HTTPRequest& request) {
  const auto& fields = request.headers.fields();
  return request.method == "GET" && !request.body &&
         std::none_of(fields.begin(), fields.end(),
                      [](const auto& field) { return isAmong(field.first, kConditions); });
}

bool isStorable(const HTTPRequest& request, int status, const HTTPHeaders& headers) {
  // No redirect: one request wants it followed, another wants to see it.
  static constexpr std::array kStatuses{200, 203, 404, 410};
  if (std::find(kStatuses.begin(), kStatuses.end(), status) == kStatuses.end()) return false;
  const Directives response = directives(headers);
  if (response.noStore || directives(request.headers).noStore || variesByEverything(headers)) return false;
  if (hasValidator(headers)) return true;
  // The time of arrival matters only beside an Expires without Date; then any past time will do.
  return !response.noCache && freshnessLifetime(headers, WallTime{}) > Duration{};
}

Duration currentAge(const StoredResponse& stored, WallTime now) {
  const auto made = date(stored.headers, "Date").value_or(stored.responseTime);
  const auto apparent = std::max(stored.responseTime - made, Duration{});
  const std::string* age = stored.headers.find("Age");
  const Duration stated = age == nullptr ? seconds(0) : deltaSeconds(trimmed(*age)).value_or(seconds(0));
  const auto delay = std::max(stored.responseTime - stored.requestTime, Duration{});
  const auto resident = now - stored.responseTime;
  // A clock that was set back says nothing about the age: such a response is validated.
  if (resident < Duration{}) return seconds(kMaximumDeltaSeconds);
  return std::max(apparent, stated + delay) + resident;
}

Reuse reuse(const StoredResponse& stored, const HTTPRequest& request, WallTime now) {
  if (!matches(stored.varied, request.headers)) return Reuse::never;
  const Directives asked = directives(request.headers);
  const auto age = currentAge(stored, now);
  const auto lifetime = freshnessLifetime(stored.headers, stored.responseTime);
  const bool usable = !asked.noCache && !directives(stored.headers).noCache &&
                      age + asked.minimumFreshness.value_or(seconds(0)) < lifetime &&
                      (!asked.maximumAge || age <= *asked.maximumAge);
  if (usable) return Reuse::asItIs;
  return hasValidator(stored.headers) ? Reuse::afterValidation : Reuse::never;
}

HTTPHeaders variedFields(const HTTPHeaders& request, const HTTPHeaders& response) {
  HTTPHeaders result;
  const std::string vary = combined(response, "Vary");
  forEachMember(vary, [&](std::string_view name) { result.set(name, combined(request, name)); });
  return result;
}

void addConditions(const StoredResponse& stored, HTTPHeaders& request) {
  if (const auto* tag = stored.headers.find("ETag")) request.set("If-None-Match", *tag);
  if (const auto* modified = stored.headers.find("Last-Modified"))
    request.set("If-Modified-Since", *modified);
}

StoredResponse validated(const StoredResponse& stored, const HTTPHeaders& notModified, WallTime requestTime,
                         WallTime responseTime) {
  StoredResponse result = stored;
  result.requestTime = requestTime;
  result.responseTime = responseTime;
  // They told the age of the old answer.
  result.headers.remove("Age");
  result.headers.remove("Date");
  const auto isKept = [&](const std::string& name) { return isAmong(name, kOfTheMessage); };
  for (const auto& [name, value] : notModified.fields()) {
    if (!isKept(name)) result.headers.remove(name);
  }
  for (const auto& [name, value] : notModified.fields()) {
    if (!isKept(name)) result.headers.add(name, value);
  }
  return result;
}

bool invalidates(const HTTPRequest& request, int status) {
  static constexpr std::array<std::string_view, 4> kSafe{"GET", "HEAD", "OPTIONS", "TRACE"};
  return status >= 200 && status < 400 && !isAmong(request.method, kSafe);
}

}  // namespace sable::platform::host
