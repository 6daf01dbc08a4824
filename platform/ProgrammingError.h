#pragma once

#include <string_view>

namespace sable::platform {

/// Stops the process because its own code broke a rule. The message goes to the log, or to
/// standard error when the log shows no faults.
[[noreturn]] void programmingError(std::string_view message);

}  // namespace sable::platform
