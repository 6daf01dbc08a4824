#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable::platform {

inline constexpr std::string_view kMapsServiceDidChangeNotification = "MapsServiceDidChange";

/// The maps application's session, so that a search and a later map request can be told to belong
/// together without naming the user.
class MapsService {
 public:
  virtual ~MapsService() = default;

  struct SessionEntity {
    std::string sessionId;     ///< empty when the service has none
    std::string entityString;  ///< what is handed to clients
  };

  /// The session entity; `reset` begins a new session first. nullopt without a maps service.
  virtual std::optional<SessionEntity> userSessionEntity(bool reset) = 0;
  virtual std::string environmentName() const = 0;
  virtual std::optional<std::string> clientMetadata() const = 0;
};

}  // namespace sable::platform
