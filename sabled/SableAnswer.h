#pragma once

#include <optional>
#include <string>

namespace sable {

/// What an answer of the service says of itself, for the record of its end.
struct SableAnswer {
  std::optional<std::string> status;  ///< also the daemon's word for a failure
  double duration = 0;                ///< seconds that the service took
  std::optional<std::string> fbq;
  std::optional<std::string> partialClientIP;
};

}  // namespace sable
