#include "sabled/SableDPAppDeepLinkIngester.h"

#include <algorithm>
#include <nlohmann/json.hpp>
#include <set>

#include "platform/Dictionary.h"
#include "platform/DifferentialPrivacy.h"
#include "platform/ManagedConfiguration.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/DeepLinkTarget.h"
#include "sabled/SableLogging.h"
#include "sabled/SableRelayActivity.h"
#include "sabled/SableRelayCriteria.h"

namespace sable {
namespace {

constexpr std::string_view kActivity = "com.kestrel.Sable.DeepLinkIngest";
/// What the reports answer: where does an application have public content?
constexpr std::string_view kQuestion = "com.kestrel.sable.deeplink";
/// A day and what was reported on it: {"day" (since 1970, UTC), "reports"}.
constexpr std::string_view kReportsKey = "SBLDeepLinkReports";

/// A day's links that are looked at; an index below it takes a byte to draw.
constexpr std::size_t kMaximumFiles = 256;

constexpr double kDay = 24 * 60 * 60;  // seconds

platform::ActivityCriteria maintenanceCriteria() {
  auto criteria = SableRelayCriteria::createCriteria();
  SableRelayCriteria::setRepeating(true, criteria);
  SableRelayCriteria::setInterval(kDay, criteria);
  // It takes milliseconds and sends nothing, and links should not lie about for long. So it waits neither
  // for power nor after the start: a daemon that is started on demand may not live to see an hour.
  SableRelayCriteria::setAllowBatteryUsage(true, criteria);
  return criteria;
}

}  // namespace

void SableDPAppDeepLinkIngester::scheduleMaintenance() {
  SableRelayActivity::registerActivityWithIdentifier(
      assembly_.platform.activityScheduler(), std::string(kActivity), maintenanceCriteria(),
      [this](const SableRelayActivity::Activity&) { ingest(); });
}

void SableDPAppDeepLinkIngester::ingest() {
  const bool allowed = assembly_.platform.managedConfiguration().diagnosticsSubmissionAllowed();
  const auto content = assembly_.platform.deepLinkSpool().take(allowed ? kMaximumFiles : 0);
  const std::size_t found = content.links.size() + content.refused + content.unread + content.stuck;
  if (found == 0) return;
  SableDefaultLog().info("deep links: {} read, {} refused, {} deleted unread, {} stuck", content.links.size(),
                         content.refused, content.unread, content.stuck);
  report(targetsOf(content.links));
}

SableDPAppDeepLinkIngester::Targets SableDPAppDeepLinkIngester::targetsOf(
    const std::vector<platform::DeepLink>& links) {
  std::set<std::string> targets;
  for (const platform::DeepLink& link : links) {
    if (auto target = deepLinkTarget(link)) targets.insert(*std::move(target));
  }
  return {targets.begin(), targets.end()};
}

void SableDPAppDeepLinkIngester::report(Targets targets) {
  if (targets.empty()) return;
  // Spent before anything is told: who is killed in between tells less, never more.
  const std::int64_t count = spendReports(static_cast<std::int64_t>(targets.size()));
  for (std::int64_t i = 0; i < count; ++i) {
    const auto chosen = platform::uniformBelow(assembly_.runtime, static_cast<unsigned>(targets.size()));
    assembly_.platform.differentialPrivacy().record(
        {std::string(kQuestion), platform::randomizedAnswer(assembly_.runtime, targets[chosen])});
    targets.erase(targets.begin() + chosen);
  }
  SableDefaultLog().info("deep links: {} targets left unreported", targets.size());
}

std::int64_t SableDPAppDeepLinkIngester::spendReports(std::int64_t wanted) {
  const auto today =
      std::chrono::floor<std::chrono::days>(assembly_.runtime.now()).time_since_epoch().count();
  const Dictionary before = assembly_.userDefaults.dictionary(kReportsKey).value_or(Dictionary());
  const bool isToday = integerMember(before, "day") == today;
  const std::int64_t spent =
      isToday ? std::max<std::int64_t>(0, integerMember(before, "reports").value_or(0)) : 0;
  const std::int64_t count = std::clamp<std::int64_t>(kSBLDeepLinkReportsPerDay - spent, 0, wanted);
  assembly_.userDefaults.set(kReportsKey, {{"day", today}, {"reports", spent + count}});
  assembly_.userDefaults.synchronize();
  return count;
}

}  // namespace sable
