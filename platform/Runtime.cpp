#include "platform/Runtime.h"

#include <fmt/core.h>

#include <cmath>

#include "platform/ProgrammingError.h"

namespace sable::platform {

double secondsSince1970(WallTime time) {
  return toSeconds(time.time_since_epoch());
}

WallTime wallTimeFromSecondsSince1970(double seconds) {
  return WallTime(fromSeconds(seconds));
}

double toSeconds(Duration duration) {
  return std::chrono::duration<double>(duration).count();
}

Duration fromSeconds(double seconds) {
  // The ends of the range stand for "forever", and what is no number lasts no time.
  const double nanoseconds = std::nearbyint(seconds * 1e9);
  if (std::isnan(nanoseconds)) return Duration::zero();
  if (nanoseconds >= 0x1p63) return Duration::max();
  if (nanoseconds <= -0x1p63) return Duration::min();
  return Duration(static_cast<Duration::rep>(nanoseconds));
}

Timer& Timer::operator=(Timer&& other) noexcept {
  if (this != &other) {
    cancel();
    implementation_ = std::move(other.implementation_);
  }
  return *this;
}

void Timer::cancel() {
  // Taken out first: what the work captured may hold this very timer.
  if (const auto implementation = std::exchange(implementation_, nullptr)) implementation->cancel();
}

void SerialQueue::assertIsCurrent() const {
  if (!isCurrent()) programmingError(fmt::format("not on queue {}", label()));
}

UUID Runtime::uuid() {
  UUID uuid;
  randomBytes(std::as_writable_bytes(std::span(uuid.bytes)));
  uuid.bytes[6] = static_cast<std::uint8_t>((uuid.bytes[6] & 0x0F) | 0x40);
  uuid.bytes[8] = static_cast<std::uint8_t>((uuid.bytes[8] & 0x3F) | 0x80);
  return uuid;
}

}  // namespace sable::platform
