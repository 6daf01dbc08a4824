#pragma once

#include <string>

#include "platform/Dictionary.h"
#include "platform/Error.h"

namespace sable {

/// Codes in kSBLErrorDomain. They reach clients and the service: never renumber.
enum class SBLErrorCode : std::int64_t {
  bagMissing = 1,    ///< "timeout", "no UserAgent"
  network = 2,       ///< "no data", "not JSON object", "statusCode %ld"
  daemonSide = 500,  ///< "invalid response class", "invalid configuration", ...
};

Error makeSBLError(SBLErrorCode code, std::string reason);

/// {"code", "domain", "reason"}, the form in which errors are uploaded; an empty text is null.
Dictionary encodeErrorForJSON(const Error& error);

}  // namespace sable
