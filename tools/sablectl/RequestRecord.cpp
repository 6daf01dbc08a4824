#include "tools/sablectl/RequestRecord.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <optional>
#include <string_view>

namespace sable::sablectl {
namespace {

using platform::RelayValue;

constexpr std::string_view kQueryItems = "queryItems";

/// The members that any request may have, by their D-Bus type.
struct Member {
  std::string_view name;
  char type;
};
constexpr std::array kMembers{
    Member{"queryId", 't'},        Member{"clientQueryId", 't'},
    Member{"queryString", 's'},    Member{"triggerEvent", 'x'},
    Member{"scale", 'd'},          Member{"keyboardInputMode", 's'},
    Member{"verboseReply", 'b'},   Member{"topics", 's'},
    Member{"moreResultsURL", 's'}, Member{"cardURL", 's'},
    Member{"appBundleId", 's'},    Member{"domain", 's'},
    Member{"queryContext", 's'},   Member{"lookupSelectionType", 'x'},
};

template <class Number>
std::optional<RelayValue> number(std::string_view text) {
  Number value{};
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

std::optional<RelayValue> boolean(std::string_view text) {
  if (text == "true" || text == "1") return true;
  if (text == "false" || text == "0") return false;
  return std::nullopt;
}

std::optional<RelayValue> valueOfType(char type, const std::string& text) {
  switch (type) {
    case 't':
      return number<std::uint64_t>(text);
    case 'x':
      return number<std::int64_t>(text);
    case 'd':
      return number<double>(text);
    case 'b':
      return boolean(text);
    default:
      return text;
  }
}

std::string_view typeInWords(char type) {
  switch (type) {
    case 't':
      return "an integer from 0";
    case 'x':
      return "an integer";
    case 'd':
      return "a number";
    default:
      return "true or false";
  }
}

tl::unexpected<Error> unusable(std::string reason) {
  return tl::unexpected(Error{"Usage", 0, std::move(reason)});
}

}  // namespace

Expected<std::pair<std::string, std::string>> nameAndValue(const std::string& word) {
  const std::size_t equals = word.find('=');
  if (equals == std::string::npos || equals == 0)
    return unusable(fmt::format("\"{}\" is not of the form NAME=VALUE", word));
  return std::pair(word.substr(0, equals), word.substr(equals + 1));
}

Expected<platform::RelayRecord> requestRecord(const std::vector<std::string>& words) {
  platform::RelayRecord record;
  platform::RelayStringPairs items;
  for (const std::string& word : words) {
    const auto pair = nameAndValue(word);
    if (!pair) return tl::unexpected(pair.error());
    const auto& [name, text] = *pair;
    if (name.starts_with(kQueryItems) && name.substr(kQueryItems.size()).starts_with('.')) {
      items.pairs.emplace_back(name.substr(kQueryItems.size() + 1), text);
      continue;
    }
    const auto member = std::ranges::find(kMembers, name, &Member::name);
    if (member == kMembers.end()) return unusable(fmt::format("a request has no member \"{}\"", name));
    auto value = valueOfType(member->type, text);
    if (!value) return unusable(fmt::format("{} is {}, not \"{}\"", name, typeInWords(member->type), text));
    record.add(name, std::move(*value));
  }
  if (!items.pairs.empty()) record.add(std::string(kQueryItems), std::move(items));
  return record;
}

}  // namespace sable::sablectl
