#pragma once

#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/RelayValue.h"

namespace sable::sablectl {

/// The request record of "NAME=VALUE" words, each member with the type that it has on the wire;
/// "queryItems.NAME=VALUE" adds a query item. The error's reason names the word at fault.
Expected<platform::RelayRecord> requestRecord(const std::vector<std::string>& words);

/// Splits "NAME=VALUE" at the first "="; the error's reason names the word.
Expected<std::pair<std::string, std::string>> nameAndValue(const std::string& word);

}  // namespace sable::sablectl
