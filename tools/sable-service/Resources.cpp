#include "Resources.h"

#include <fmt/chrono.h>
#include <fmt/format.h>

#include <charconv>
#include <ctime>

namespace service {

namespace {

constexpr std::string_view kFolder = "/resources/";

/// Applications by name, each with its place in the bitmap of those that a device has.
std::string allowList() {
  const Json applications = {{"org.debian.Example", {{{"encoding_id", 1}}}},
                             {"org.kestrel.Reader", {{{"encoding_id", 3}}}},
                             {"org.example.Mail", {{{"encoding_id", 12}}}},
                             {"org.gnome.Terminal", {{{"encoding_id", 20}}}}};
  const Json inner = {{"version", "0001"}, {"apps", applications}};
  return toText({{"apps", toText(inner)}, {"compression", "RLE"}, {"encoding", "bitmap"}});
}

bool isRedirected(std::string_view identifier) {
  return identifier.starts_with("lookup_hints_");
}

std::string today() {
  return fmt::format("{:%Y-%m-%d}", fmt::gmtime(std::time(nullptr)));
}

/// The length that ?bytes=N asks for, nullopt where it is no number; `least` without that item.
std::optional<size_t> lengthOf(const Request& request, size_t least) {
  const auto text = request.item("bytes");
  if (!text) return least;
  size_t length = 0;
  const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), length);
  const bool isNumber = error == std::errc() && end == text->data() + text->size();
  return isNumber && length >= least ? std::optional(length) : std::nullopt;
}

}  // namespace

// The hints name the parts of speech they are for; clients only hand them on.
Resources::Resources() {
  set("lookup_hints_weekly", "noun\nverb\n");
  set("lookup_hints_monthly", "adjective\nadverb\n");
  set("installed_app_whitelist", allowList());
}

void Resources::set(const std::string& identifier, std::string content) {
  Resource& resource = resources_[identifier];
  resource.content = std::move(content);
  resource.date = today();
  ++resource.revision;
}

std::string Resources::path(const std::string& identifier) const {
  std::string path = fmt::format("{}{}", kFolder, percentEncode(identifier));
  if (!isRedirected(identifier)) path += fmt::format("?version={}", resources_.at(identifier).revision);
  return path;
}

Answer Resources::answer(const Request& request) const {
  const std::string name = request.path.substr(kFolder.size());
  const std::string identifier = name.substr(0, name.find('/'));
  const auto found = resources_.find(identifier);
  if (found == resources_.end()) return Answer::error(404, "there is no such resource");
  const auto& [content, date, revision] = found->second;
  const std::string place = fmt::format("{}/{}/{}/file", identifier, date, revision);
  if (name != identifier && name != place) return Answer::error(404, "there is no such revision");

  const std::string version = isRedirected(identifier) ? fmt::format("{}-{}-{}", date, revision, identifier)
                                                       : fmt::format("{}", revision);
  if (request.header("If-None-Match") == version) return Answer::empty(304);
  if (isRedirected(identifier) && name != place) {
    Answer answer = Answer::empty(302);
    const std::string query = request.item("bytes") ? "?bytes=" + percentEncode(*request.item("bytes")) : "";
    answer.headers.emplace_back("Location", fmt::format("{}{}{}", kFolder, place, query));
    return answer;
  }
  const auto length = lengthOf(request, content.size());
  if (!length) return Answer::error(400, "bytes is wrong");
  Answer answer = Answer::tagged(request, "application/octet-stream", content, "private, no-cache");
  if (answer.status == 200) answer.zeros = *length - content.size();
  return answer;
}

}  // namespace service
