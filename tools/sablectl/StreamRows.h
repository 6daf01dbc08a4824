#pragma once

#include <string>
#include <string_view>

#include "platform/Runtime.h"
#include "tools/sablectl/Output.h"

/// A stream of records for a person: a row for each as it comes, in columns of known widths, within
/// the width of the output.
namespace sable::sablectl {

/// Names of the columns of feedbackRow() or sessionRow().
std::string feedbackHeading(const Output& output);
std::string sessionHeading(const Output& output);

/// "12:03:04.123  search_start                  7  input=wea  trigger_event=tap": the local time, the
/// kind, the query's id, and the other members that say something; of lists and objects their size.
std::string feedbackRow(const Output& output, platform::WallTime time, const Dictionary& feedback);

/// "12:03:04.123       12  1B4E28BA  external request         Rover/1": the local time, how many records it
/// has, the beginning of its user GUID, why the session before it ended, and the client's own agent.
std::string sessionRow(const Output& output, platform::WallTime time, const Dictionary& envelope);

/// "12:03:04.123  124 records left out: ...".
std::string droppedRow(const Output& output, platform::WallTime time, std::uint64_t count);

}  // namespace sable::sablectl
