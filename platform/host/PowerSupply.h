#pragma once

#include <filesystem>

namespace sable::platform::host {

/// Whether the machine lives off a battery: one discharges and nothing else feeds it, by what
/// sys/class/power_supply below `root` says (Linux, Documentation/ABI/testing/sysfs-class-power). A
/// machine without a battery of its own does not; batteries of mice and keyboards do not count.
bool runsOnBattery(const std::filesystem::path& root);

}  // namespace sable::platform::host
