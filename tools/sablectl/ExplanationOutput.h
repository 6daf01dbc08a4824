#pragma once

#include <string>
#include <vector>

#include "tools/sablectl/Output.h"

namespace sable::sablectl {

/// What SBLDiagnosticsRelay's Explain answered, for a person: the gates, the cache's candidates and
/// how the request came about. Members that are missing are shown as nothing.
std::vector<std::string> explanationLines(const Output& output, const Dictionary& explanation);

}  // namespace sable::sablectl
