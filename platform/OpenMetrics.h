#pragma once

#include <cstdint>
#include <map>
#include <string>

namespace sable::platform {

/// Counters in the OpenMetrics text format: one gauge family "sabled_tally" whose label `key` is
/// the counter's name as it stands (names are free text, and a counter may be set back).
std::string openMetricsText(const std::map<std::string, std::int64_t>& snapshot);

}  // namespace sable::platform
