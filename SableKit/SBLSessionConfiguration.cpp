#include "SableKit/SBLSessionConfiguration.h"

#include <fmt/core.h>

namespace sable {

std::string SBLSessionConfiguration::description() const {
  return fmt::format("{{identifier: {}, userAgent: {}}}", identifier.value_or("(null)"),
                     userAgent.value_or("(null)"));
}

}  // namespace sable
