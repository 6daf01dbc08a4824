#pragma once

#include <string>
#include <vector>

#include "tools/sablectl/Output.h"

namespace sable::sablectl {

/// What SBLDiagnosticsRelay's Privacy answered, for a person. Members that are missing are shown as
/// nothing.
std::vector<std::string> privacyLines(const Output& output, const Dictionary& report);

}  // namespace sable::sablectl
