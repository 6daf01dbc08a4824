#pragma once

#include <string>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/RelayValue.h"

namespace sable::sablectl {

/// A record as JSON. Data is told by its size ("12 bytes"), a file as "file".
Dictionary recordDocument(const platform::RelayRecord& record);
Dictionary recordDocuments(const platform::RelayRecords& records);

/// An array of objects as a table: a column for each key, in order of appearance, under its name.
/// "none" when it is empty.
std::vector<std::string> tableLines(const Dictionary& objects);

}  // namespace sable::sablectl
