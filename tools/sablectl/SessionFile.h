#pragma once

#include <cstddef>
#include <string_view>

#include "platform/Dictionary.h"

namespace sable::sablectl {

/// What a session file holds (docs/feedback.md has its layout), as far as it can be read: {"version":
/// the user agent of the daemon that wrote it, "root": the session without its feedback, "records":
/// [{"class", "query_id", "client_query_id", "message"}], "damage": {"offset", "reason"} of the record
/// at which reading had to stop, in bytes, or null}. A version or root that is not there is null.
Dictionary sessionFileDocument(std::string_view bytes);

/// The feedback records in a session file; a torn one does not count.
std::size_t recordsInSessionFile(std::string_view bytes);

}  // namespace sable::sablectl
