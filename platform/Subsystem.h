#pragma once

#include <string_view>

namespace sable::platform {

/// The name under which this program's log lines, counters and folders are known.
inline constexpr std::string_view kSubsystem = "com.kestrel.sabled";

}  // namespace sable::platform
