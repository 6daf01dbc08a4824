#include "SableKit/SBLTracing.h"

#include <atomic>
#include <mutex>

#include "SableKit/SBLConstants.h"
#include "platform/Log.h"

namespace sable {
namespace {

constexpr platform::LogHandle kDefaultLog{kSBLSubsystem, ""};
std::atomic<bool> traceEnabled{false};

}  // namespace

void SBLTracingSetup(const platform::UserDefaults& userDefaults) {
  static std::once_flag once;
  std::call_once(once, [&] {
    traceEnabled = userDefaults.boolean("TraceEnabled").value_or(false);
    kDefaultLog.info("SBLTraceEnabled flag set to {:d}", traceEnabled.load());
  });
}

bool SBLTraceEnabled() {
  return traceEnabled.load(std::memory_order_relaxed);
}

void SBLTracePoint(std::uint32_t code) {
  if (SBLTraceEnabled()) kDefaultLog.debug("trace point {:#010x}", code);
}

}  // namespace sable
