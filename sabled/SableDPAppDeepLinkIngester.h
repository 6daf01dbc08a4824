#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/DeepLinkSpool.h"

namespace sable {

class Assembly;

/// How many reports of deep links leave in a day, UTC; each has an epsilon of 1.946
/// (platform/LocalRandomizer.h), the day 7.8.
inline constexpr std::int64_t kSBLDeepLinkReportsPerDay = 4;

/// Once a day reports where applications have public content, from the deep links that they drop, and
/// empties the spool. What is reported is drawn from the day's different targets (deepLinkTarget) and
/// randomised at once; the links go no further than this object, not into a log line either.
///
/// Where diagnostics are not allowed the spool is emptied unread: what a user did before allowing them is
/// not told afterwards. A link that is not reported is not kept for another day.
class SableDPAppDeepLinkIngester {
 public:
  explicit SableDPAppDeepLinkIngester(Assembly& assembly) : assembly_(assembly) {}

  /// Registers the maintenance with the platform's scheduler; the ingester lives as long as the process.
  void scheduleMaintenance();

 private:
  using Targets = std::vector<std::string>;

  void ingest();
  static Targets targetsOf(const std::vector<platform::DeepLink>& links);
  void report(Targets targets);
  std::int64_t spendReports(std::int64_t wanted);

  Assembly& assembly_;
};

}  // namespace sable
