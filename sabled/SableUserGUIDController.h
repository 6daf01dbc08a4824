#pragma once

#include <memory>
#include <string_view>

#include "platform/Runtime.h"
#include "platform/UUID.h"

namespace sable {

class Assembly;

/// Posted after the user GUID has changed.
inline constexpr std::string_view kSBLUserGUIDChangeNotification = "SBLUserGUIDChangeNotification";

/// How long a user GUID is used.
inline constexpr platform::Duration kSBLUserGUIDLifetime = std::chrono::seconds(900);

/// The anonymous GUID under which a user's searches and feedback leave the device. It means nothing
/// beyond its short life: it is random, never stored, and rolls when it is too old or reset. Any
/// thread.
class SableUserGUIDController {
 public:
  explicit SableUserGUIDController(Assembly& assembly);

  struct Current {
    UUID guid;
    platform::WallTime expires;
  };
  /// The GUID in use; rolls first when its time is up.
  UUID currentUserGUID() { return current().guid; }
  Current current();
  /// Rolls soon: a following currentUserGUID() on any thread sees the new one.
  void reset();

 private:
  void roll();

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;

  // On queue_.
  UUID lastKnownUserGUID_;
  platform::WallTime lastKnownUserGUIDExpirationDate_;
};

}  // namespace sable
