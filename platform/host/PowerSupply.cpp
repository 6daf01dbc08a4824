#include "platform/host/PowerSupply.h"

#include <fstream>
#include <string>

namespace sable::platform::host {
namespace {

/// The first word of a file; empty where there is none.
std::string attribute(const std::filesystem::path& supply, const char* name) {
  std::ifstream file(supply / name);
  std::string word;
  file >> word;
  return word;
}

}  // namespace

bool runsOnBattery(const std::filesystem::path& root) {
  bool discharging = false;
  std::error_code ignored;
  for (const auto& supply : std::filesystem::directory_iterator(root / "sys/class/power_supply", ignored)) {
    if (attribute(supply, "scope") == "Device") continue;
    const bool battery = attribute(supply, "type") == "Battery";
    if (!battery && attribute(supply, "online") == "1") return false;
    discharging = discharging || (battery && attribute(supply, "status") == "Discharging");
  }
  return discharging;
}

}  // namespace sable::platform::host
