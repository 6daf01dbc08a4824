#pragma once

#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/host/Folders.h"
#include "platform/host/TOMLFile.h"

namespace sable::platform::host {

enum class ValueType {
  boolean,
  integer,
  number,
  string,
  date,
  array,
  strings,
  table,
  tables,
  location,
  subscriptions
};

/// "a boolean", "an array of strings".
std::string_view typeName(ValueType type);
bool hasType(const TOMLValue& value, ValueType type);

struct KnownKey {
  std::string_view name;
  ValueType type;
};

/// Settings (defaults.toml) that some part of the daemon reads.
std::span<const KnownKey> knownSettings();
/// Facts (facts.toml).
std::span<const KnownKey> knownFacts();

/// The key's entry, or null.
const KnownKey* findKey(std::span<const KnownKey> known, std::string_view name);

/// What is wrong in the settings and facts files as they are now, one text each:
/// "FILE:LINE:COLUMN: KEY: problem". Unknown keys and wrong types count; missing files do not.
std::vector<std::string> checkConfiguration(const Folders& folders);

}  // namespace sable::platform::host
