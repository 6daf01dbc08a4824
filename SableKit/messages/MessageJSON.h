#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/Error.h"

/// Feedback messages in protobuf's JSON form, for tools and tests: by reflection, on the full
/// runtime, which the daemon does without. Any thread.
namespace sable {

/// Reading and writing that form.
inline constexpr std::string_view kMessageErrorDomain = "MessageErrorDomain";
enum class MessageErrorCode : std::int64_t { unknownClass = 1, malformed = 2 };

/// The bytes of a message of the class, as ReportEvent takes them. A field that the class does not
/// have, or a value that does not fit it, is an error whose reason names it.
Expected<std::string> messageFromJSON(std::string_view className, std::string_view json);

/// The JSON form of a message's bytes, with every field in its place and absent ones left out.
Expected<std::string> messageToJSON(std::string_view className, std::string_view bytes);

/// A feedback record of a session file (a `_SKSableFeedback`) as {"class", "query_id",
/// "client_query_id", "message"}, the message in that form.
Expected<Dictionary> feedbackRecordDocument(std::string_view bytes);

/// The names of all messages, in the order of their definition.
std::vector<std::string> messageClassNames();

}  // namespace sable
