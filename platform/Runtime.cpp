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

// Seconds and their fraction go separately: times of day have more nanoseconds than a double has
// digits, and a date must survive the way there and back.
double toSeconds(Duration duration) {
  const auto whole = std::chrono::floor<std::chrono::seconds>(duration);
  return static_cast<double>(whole.count()) + static_cast<double>((duration - whole).count()) / 1e9;
}

Duration fromSeconds(double seconds) {
  constexpr double kMost = 9.2e9;  // as far as nanoseconds in 64 bits reach; beyond is "for ever"
  if (std::isnan(seconds)) return Duration::zero();
  if (seconds > kMost) return Duration::max();
  if (seconds < -kMost) return Duration::min();
  const double whole = std::floor(seconds);
  return std::chrono::seconds(static_cast<std::int64_t>(whole)) +
         Duration(std::llround((seconds - whole) * 1e9));
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
