#pragma once

#include "platform/ActivityScheduler.h"

namespace sable {

/// When a background activity may run, put together criterion by criterion; times in seconds.
class SableRelayCriteria {
 public:
  static platform::ActivityCriteria createCriteria();
  static void setRepeating(bool repeating, platform::ActivityCriteria& criteria);
  static void setDelay(double seconds, platform::ActivityCriteria& criteria);
  static void setGracePeriod(double seconds, platform::ActivityCriteria& criteria);
  static void setAllowBatteryUsage(bool allow, platform::ActivityCriteria& criteria);
  static void setInterval(double seconds, platform::ActivityCriteria& criteria);
};

}  // namespace sable
