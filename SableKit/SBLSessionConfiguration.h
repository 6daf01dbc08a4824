#pragma once

#include <optional>
#include <string>

namespace sable {

/// How a client introduces itself. Connections with one identifier share one client state.
struct SBLSessionConfiguration {
  std::optional<std::string> identifier;
  std::optional<std::string> userAgent;  ///< the client's own, such as the calling application's

  /// For log lines and error reasons.
  std::string description() const;
};

}  // namespace sable
