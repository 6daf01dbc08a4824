#include "sabled/SableUserGUIDController.h"

#include "platform/NotificationCenter.h"
#include "platform/Tally.h"
#include "sabled/Assembly.h"

namespace sable {

SableUserGUIDController::SableUserGUIDController(Assembly& assembly)
    : assembly_(assembly),
      queue_(assembly.runtime.serialQueue("com.kestrel.sable.guid")),
      lastKnownUserGUID_(assembly.runtime.uuid()),
      lastKnownUserGUIDExpirationDate_(assembly.runtime.now() + kSBLUserGUIDLifetime) {}

SableUserGUIDController::Current SableUserGUIDController::current() {
  return queue_->sync([this] {
    if (lastKnownUserGUIDExpirationDate_ <= assembly_.runtime.now()) roll();
    return Current{lastKnownUserGUID_, lastKnownUserGUIDExpirationDate_};
  });
}

void SableUserGUIDController::reset() {
  queue_->async([this] { roll(); });
}

void SableUserGUIDController::roll() {
  queue_->assertIsCurrent();
  lastKnownUserGUID_ = assembly_.runtime.uuid();
  lastKnownUserGUIDExpirationDate_ = assembly_.runtime.now() + kSBLUserGUIDLifetime;
  queue_->async([this] {
    assembly_.tally.add("com.kestrel.sabled.userguid", 1);
    assembly_.notificationCenter.post({kSBLUserGUIDChangeNotification, nullptr, {}});
  });
}

}  // namespace sable
