#pragma once

#include <string>

namespace sable::platform {

/// What a user did with a client, in the words of the device's store of activities.
struct Interaction {
  std::string domain;     ///< whose: "Rover"
  std::string verb;       ///< what: "Engagement"
  std::string parameter;  ///< name of what it was done with
  std::string value;
};

/// The device's store of what its user does, from which suggestions are made. What is given to it
/// stays on the device. Any thread; never blocks. Without such a store it does nothing.
class UserActivity {
 public:
  virtual ~UserActivity() = default;
  virtual void donate(Interaction interaction) = 0;
};

}  // namespace sable::platform
