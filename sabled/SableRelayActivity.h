#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/ActivityScheduler.h"

namespace sable {

/// The device's background activities in the daemon's words. Any thread.
class SableRelayActivity {
 public:
  using Activity = std::shared_ptr<platform::Activity>;
  using Handler = platform::ActivityScheduler::Handler;

  static void registerActivityWithIdentifier(platform::ActivityScheduler& scheduler, std::string identifier,
                                             const platform::ActivityCriteria& criteria, Handler handler);
  static void unregister(platform::ActivityScheduler& scheduler, std::string_view identifier);
  /// Whether the step was accepted.
  static bool setState(platform::ActivityState state, const Activity& activity);
  static platform::ActivityState getStateForActivity(const Activity& activity);
  static bool shouldDefer(const Activity& activity);
};

}  // namespace sable
