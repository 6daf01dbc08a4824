#pragma once

#include <optional>
#include <string>

#include "tools/sablectl/Output.h"
#include "tools/sablectl/Session.h"

/// How an answer to a request is shown.
namespace sable::sablectl {

/// {"query_id", "reply": {"scale", "data", "source", "http_request", "http_response"} or null,
/// "error": {"code", "domain", "reason"} or null, "milliseconds"}.
Dictionary answerDocument(const Answer& answer);

/// Where the reply came from: "network" or "cache"; nullopt when there is no reply, or when the
/// request did not ask.
std::optional<std::string> sourceOf(const Answer& answer);

/// The completed query of the first result set that completes `input`, else of the first; nullopt when
/// the reply has none. An answer from the cache was made for less than what is typed now.
std::optional<std::string> bestCompletion(const Answer& answer, std::string_view input);

/// The answer for a person, as lines; its error is told elsewhere.
std::vector<std::string> answerLines(const Output& output, const Answer& answer);

}  // namespace sable::sablectl
