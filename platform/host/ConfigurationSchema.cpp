#include "platform/host/ConfigurationSchema.h"

#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <nlohmann/json.hpp>

#include "platform/UserDefaults.h"

namespace sable::platform::host {

namespace {

using enum ValueType;

constexpr std::array kSettings{
    KnownKey{"SBLAppWhitelistSignature", string}, KnownKey{"SBLBagURL", string},
    KnownKey{"SBLDebugParameters", string},       KnownKey{"SBLDefaultBagURL", string},
    KnownKey{"SBLDefaultBagURLCN", string},       KnownKey{"SBLDonateInteractions", boolean},
    KnownKey{"SBLHashtagImagesVisible", boolean}, KnownKey{"SBLKeepUploads", boolean},
    KnownKey{"SBLKeepPrivateReports", boolean},   KnownKey{"SBLNewsVisible", boolean},
    KnownKey{"SBLNoParallax", boolean},           KnownKey{"SBLNoQueryCache", boolean},
    KnownKey{"SBLPersistSessions", boolean},      KnownKey{"SBLSessionMaxAge", integer},
    KnownKey{"SBLSessionSizeLimit", integer},     KnownKey{"SBLSharedSession", boolean},
    KnownKey{"SBLUseBramble", boolean},           KnownKey{"TraceEnabled", boolean},
};

/// Of the domain that the clients of lookups share.
constexpr std::array kLookupSettings{KnownKey{"LookupSuggestionsDisabled", boolean}};

/// Of a file that a provider drops.
constexpr std::array kDroppedFacts{KnownKey{"subscriptions", subscriptions}};

constexpr std::array kFacts{
    KnownKey{"product_type", string},
    KnownKey{"product_name", string},
    KnownKey{"build_version", string},
    KnownKey{"screen_scale", number},
    KnownKey{"keyboard_input_mode", string},
    KnownKey{"locale", string},
    KnownKey{"calendar", string},
    KnownKey{"measurement_system", string},
    KnownKey{"temperature_unit", string},
    KnownKey{"preferred_languages", strings},
    KnownKey{"system_language", string},
    KnownKey{"hour_cycle_24", boolean},
    KnownKey{"time_zone", string},
    KnownKey{"country_code", string},
    KnownKey{"diagnostics_allowed", boolean},
    KnownKey{"bookstore_allowed", boolean},
    KnownKey{"media_store_allowed", boolean},
    KnownKey{"app_installation_allowed", boolean},
    KnownKey{"managed_account", boolean},
    KnownKey{"music_subscription_status", integer},
    KnownKey{"storefront", string},
    KnownKey{"geo_environment", string},
    KnownKey{"geo_session_id", string},
    KnownKey{"geo_metadata", string},
    KnownKey{"on_battery", boolean},
    KnownKey{"metered", boolean},
    KnownKey{"memory_pressure_file", string},
    KnownKey{"location", location},
    KnownKey{"subscriptions", subscriptions},
    KnownKey{"applications", tables},
};

void checkFile(const std::filesystem::path& path, std::span<const KnownKey> known,
               std::vector<std::string>& problems) {
  const auto text = readTOMLText(path);
  if (!text) {
    problems.push_back(text.error().reason);
    return;
  }
  const auto content = parseTOML(*text);
  if (!content) {
    problems.push_back(fmt::format("{}:{}", path.native(), content.error().reason));
    return;
  }
  for (const auto& [name, value] : *content) {
    const KnownKey* key = findKey(known, name);
    if (key != nullptr && hasType(value, key->type)) continue;
    const std::string problem = key == nullptr ? "unknown" : fmt::format("not {}", typeName(key->type));
    problems.push_back(
        fmt::format("{}:{}:{}: {}: {}", path.native(), value.line, value.column, name, problem));
  }
}

bool isLocation(const Dictionary& value) {
  if (!value.is_object()) return false;
  const auto items = value.items();
  return std::all_of(items.begin(), items.end(), [](const auto& member) {
    const std::string& name = member.key();
    if (name == "authorization" || name == "type") return member.value().is_number_integer();
    const bool isNumber = name == "latitude" || name == "longitude" || name == "timestamp";
    return isNumber && member.value().is_number();
  });
}

bool isSubscription(const Dictionary& value) {
  if (!value.is_object()) return false;
  const auto items = value.items();
  const bool areRight = std::all_of(items.begin(), items.end(), [](const auto& member) {
    const std::string& name = member.key();
    if (name == "modified") return member.value().is_number();
    return (name == "provider" || name == "domain" || name == "info") && member.value().is_string();
  });
  return areRight && value.contains("provider") && value.contains("modified");
}

bool allOf(const Dictionary& value, bool (Dictionary::*is)() const noexcept) {
  return value.is_array() &&
         std::all_of(value.begin(), value.end(), [is](const Dictionary& element) { return (element.*is)(); });
}

}  // namespace

std::string_view typeName(ValueType type) {
  switch (type) {
    case boolean:
      return "a boolean";
    case integer:
      return "an integer";
    case number:
      return "a number";
    case string:
      return "a string";
    case date:
      return "a date";
    case array:
      return "an array";
    case strings:
      return "an array of strings";
    case table:
      return "a table";
    case location:
      return "a table of authorization, latitude, longitude, type and timestamp, rightly typed";
    case tables:
      return "an array of tables";
    case subscriptions:
      return "an array of tables of provider and modified, domain and info, rightly typed";
  }
  return "";
}

bool hasType(const TOMLValue& entry, ValueType type) {
  const Dictionary& value = *entry.value;
  switch (type) {
    case boolean:
      return value.is_boolean();
    case integer:
      return value.is_number_integer();
    case number:
      return value.is_number() && !entry.date;
    case string:
      return value.is_string();
    case date:
      return entry.date.has_value();
    case array:
      return value.is_array();
    case strings:
      return allOf(value, &Dictionary::is_string);
    case table:
      return value.is_object();
    case location:
      return isLocation(value);
    case tables:
      return allOf(value, &Dictionary::is_object);
    case subscriptions:
      return value.is_array() && std::all_of(value.begin(), value.end(), isSubscription);
  }
  return false;
}

std::span<const KnownKey> knownSettings() {
  return kSettings;
}
std::span<const KnownKey> knownFacts() {
  return kFacts;
}

const KnownKey* findKey(std::span<const KnownKey> known, std::string_view name) {
  const auto found = std::ranges::find(known, name, &KnownKey::name);
  return found == known.end() ? nullptr : &*found;
}

std::vector<std::string> checkConfiguration(const Folders& folders) {
  std::vector<std::string> problems;
  checkFile(folders.profileSettings, knownSettings(), problems);
  checkFile(folders.userSettings(), knownSettings(), problems);
  checkFile(folders.sharedSettings(kLookupDomain), kLookupSettings, problems);
  checkFile(folders.systemFacts, knownFacts(), problems);
  checkFile(folders.userFacts(), knownFacts(), problems);
  for (const auto& folder : {folders.systemSubscriptions(), folders.userSubscriptions()}) {
    for (const auto& path : tomlFilesIn(folder)) checkFile(path, kDroppedFacts, problems);
  }
  return problems;
}

}  // namespace sable::platform::host
