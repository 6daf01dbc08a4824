#include "platform/host/LocaleNames.h"

#include <algorithm>
#include <optional>

#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

constexpr std::size_t kMaximumBytes = 4096;

bool isLetter(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
char lower(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}
char upper(char c) {
  return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
}

std::vector<std::string_view> split(std::string_view text, std::string_view separators) {
  std::vector<std::string_view> parts;
  while (!text.empty()) {
    const auto end = std::min(text.find_first_of(separators), text.size());
    if (end > 0) parts.push_back(text.substr(0, end));
    text.remove_prefix(std::min(end + 1, text.size()));
  }
  return parts;
}

/// Language, script and region of a POSIX or CLDR locale name, before any encoding or keyword.
std::vector<std::string_view> subtags(std::string_view localeIdentifier) {
  return split(localeIdentifier.substr(0, localeIdentifier.find_first_of(".@")), "_-");
}

/// A POSIX locale name as CLDR writes it; "" for the C locale.
std::string cldrName(std::string_view name) {
  const std::string_view modifier = name.find('@') == name.npos ? "" : name.substr(name.find('@') + 1);
  const auto tags = subtags(name);
  if (tags.empty() || tags[0] == "C" || tags[0] == "POSIX") return {};
  std::string result(tags[0]);
  if (modifier == "latin") result += "_Latn";
  if (modifier == "cyrillic") result += "_Cyrl";
  for (std::size_t i = 1; i < tags.size(); ++i) result.append("_").append(tags[i]);
  return result;
}

std::optional<std::string> zoneOfLink(const std::filesystem::path& root) {
  constexpr std::string_view marker = "zoneinfo/";
  std::error_code error;
  const std::string target = std::filesystem::read_symlink(root / "etc/localtime", error);
  const auto at = target.find(marker);
  if (error || at == target.npos) return std::nullopt;
  return target.substr(at + marker.size());
}

std::optional<std::string> zoneOfFile(const std::filesystem::path& root) {
  const auto path = root / "etc/timezone";
  const auto file = openTrustedFile(path, LastLink::follow);
  if (!file) return std::nullopt;
  const auto text = readWhole(*file, path, kMaximumBytes);
  if (!text) return std::nullopt;
  const auto lines = split(*text, " \t\r\n");
  return lines.empty() ? std::nullopt : std::optional<std::string>(lines[0]);
}

/// TZ names a zone as "Europe/London", ":Europe/London" or by the path of its file; its third
/// form, a rule such as "<+03>-3", has no name.
std::optional<std::string> zoneOfVariable(std::string value) {
  constexpr std::string_view marker = "zoneinfo/";
  if (value.starts_with(':')) value.erase(0, 1);
  if (const auto at = value.find(marker); at != value.npos) value.erase(0, at + marker.size());
  if (value.empty() || value.front() == '/' || value.find_first_of("<,") != value.npos) return std::nullopt;
  return value;
}

}  // namespace

std::string localeIdentifierOfHost(const Environment& environment) {
  for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
    if (const auto value = environment(name)) {
      std::string locale = cldrName(*value);
      return locale.empty() ? "en_US" : locale;
    }
  }
  return "en_US";
}

std::vector<std::string> languagesOfHost(const Environment& environment) {
  std::vector<std::string> languages;
  const auto add = [&](std::string tag) {
    if (!tag.empty() && std::ranges::find(languages, tag) == languages.end())
      languages.push_back(std::move(tag));
  };
  const std::string list = environment("LANGUAGE").value_or("");
  for (const std::string_view name : split(list, ":")) add(languageTag(cldrName(name)));
  add(languageTag(localeIdentifierOfHost(environment)));
  return languages;
}

std::string languageTag(std::string_view localeIdentifier) {
  std::string tag;
  for (const std::string_view part : subtags(localeIdentifier)) {
    if (!tag.empty()) tag += '-';
    tag += part;
  }
  return tag;
}

std::string languageOf(std::string_view localeIdentifier) {
  const auto tags = subtags(localeIdentifier);
  std::string language(tags.empty() ? "" : tags[0]);
  std::ranges::transform(language, language.begin(), lower);
  return language;
}

std::string regionOf(std::string_view localeIdentifier) {
  const auto tags = subtags(localeIdentifier);
  for (std::size_t i = 1; i < tags.size() && tags[i].size() > 1; ++i) {
    if (tags[i].size() != 2 || !std::ranges::all_of(tags[i], isLetter)) continue;
    std::string region(tags[i]);
    std::ranges::transform(region, region.begin(), upper);
    return region;
  }
  return {};
}

std::string timeZoneOfHost(const Environment& environment, const std::filesystem::path& root) {
  if (auto value = environment("TZ")) {
    if (auto zone = zoneOfVariable(*std::move(value))) return *zone;
  }
  if (auto zone = zoneOfLink(root)) return *zone;
  return zoneOfFile(root).value_or("UTC");
}

}  // namespace sable::platform::host
