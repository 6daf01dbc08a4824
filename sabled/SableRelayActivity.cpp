#include "sabled/SableRelayActivity.h"

#include <utility>

namespace sable {

void SableRelayActivity::registerActivityWithIdentifier(platform::ActivityScheduler& scheduler,
                                                        std::string identifier,
                                                        const platform::ActivityCriteria& criteria,
                                                        Handler handler) {
  scheduler.registerActivity(std::move(identifier), criteria, std::move(handler));
}

void SableRelayActivity::unregister(platform::ActivityScheduler& scheduler, std::string_view identifier) {
  scheduler.unregister(identifier);
}

bool SableRelayActivity::setState(platform::ActivityState state, const Activity& activity) {
  return activity->setState(state);
}

platform::ActivityState SableRelayActivity::getStateForActivity(const Activity& activity) {
  return activity->state();
}

bool SableRelayActivity::shouldDefer(const Activity& activity) {
  return activity->shouldDefer();
}

}  // namespace sable
