#include "SableKit/SBLError.h"

#include <nlohmann/json.hpp>

#include "SableKit/SBLConstants.h"

namespace sable {

Error makeSBLError(SBLErrorCode code, std::string reason) {
  return {std::string(kSBLErrorDomain), static_cast<std::int64_t>(code), std::move(reason)};
}

Dictionary encodeErrorForJSON(const Error& error) {
  const auto orNull = [](const std::string& text) { return text.empty() ? Dictionary() : Dictionary(text); };
  return {{"code", error.code}, {"domain", orNull(error.domain)}, {"reason", orNull(error.reason)}};
}

}  // namespace sable
