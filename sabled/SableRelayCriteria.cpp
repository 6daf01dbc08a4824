#include "sabled/SableRelayCriteria.h"

namespace sable {

using platform::ActivityCriteria;

ActivityCriteria SableRelayCriteria::createCriteria() {
  return {};
}

void SableRelayCriteria::setRepeating(bool repeating, ActivityCriteria& criteria) {
  criteria.repeating = repeating;
}

void SableRelayCriteria::setDelay(double seconds, ActivityCriteria& criteria) {
  criteria.delay = platform::fromSeconds(seconds);
}

void SableRelayCriteria::setGracePeriod(double seconds, ActivityCriteria& criteria) {
  criteria.gracePeriod = platform::fromSeconds(seconds);
}

void SableRelayCriteria::setAllowBatteryUsage(bool allow, ActivityCriteria& criteria) {
  criteria.allowBattery = allow;
}

void SableRelayCriteria::setInterval(double seconds, ActivityCriteria& criteria) {
  criteria.interval = platform::fromSeconds(seconds);
}

}  // namespace sable
