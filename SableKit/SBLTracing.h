#pragma once

#include <cstdint>

#include "platform/UserDefaults.h"

namespace sable {

/// Reads the setting "TraceEnabled" once for the life of the process and logs what it found.
/// Trace points are silent before.
void SBLTracingSetup(const platform::UserDefaults& userDefaults);

/// Whether trace points are emitted; written once by SBLTracingSetup. Any thread.
bool SBLTraceEnabled();

/// Emits a trace point as a debug line of the default log, when tracing is enabled.
void SBLTracePoint(std::uint32_t code);

}  // namespace sable
