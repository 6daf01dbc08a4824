#include "platform/host/TimeZones.h"

#include <date/tz.h>

#include <stdexcept>

namespace sable::platform::host {

std::chrono::seconds utcOffsetOf(const std::string& timeZone, WallTime time) {
  try {
    return date::locate_zone(timeZone)->get_info(std::chrono::floor<std::chrono::seconds>(time)).offset;
  } catch (const std::runtime_error&) {
    return {};
  }
}

}  // namespace sable::platform::host
