#pragma once

#include <chrono>
#include <string>

#include "platform/Runtime.h"

namespace sable::platform::host {

/// What a zone of the system's database adds to UTC at a time; 0 for a zone that is not there. The
/// names of all zones are read by the first question, a zone by the first that names it. Any thread.
std::chrono::seconds utcOffsetOf(const std::string& timeZone, WallTime time);

}  // namespace sable::platform::host
