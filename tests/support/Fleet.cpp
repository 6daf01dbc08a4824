#include "tests/support/Fleet.h"

#include <algorithm>
#include <numeric>

#include "platform/simulated/SimulatedPlatform.h"

namespace sable::test {
namespace {

using namespace std::chrono_literals;
using platform::Duration;

constexpr const char* kBody = "/tmp/body";
constexpr const char* kActivity = "flusher";

std::size_t minuteOf(Duration time) {
  return static_cast<std::size_t>(time / 1min);
}

class Device final : public platform::HTTPBackgroundSessionDelegate {
 public:
  Device(const FleetPlan& plan, std::uint64_t seed, std::vector<int>& minutes)
      : plan_(plan), minutes_(minutes), platform_(seed) {
    configuration_.identifier = "fleet";
    static_cast<void>(platform_.fileManager().createDirectory("/tmp"));
    static_cast<void>(platform_.fileManager().writeAtomically(kBody, "bytes"));
    platform_.httpSessions().service().on("/", [this](const auto&) { return answer(); });
  }

  void live() {
    start();
    platform_.runtime().advance(plan_.goodTimes + plan_.outage - plan_.powerCut);
    if (plan_.powerCut > 0s) {
      session_ = nullptr;
      platform_.activityScheduler().unregister(kActivity);
      platform_.runtime().advance(plan_.powerCut);
      start();
    }
    platform_.runtime().advance(plan_.afterwards);
  }

  void didSendBodyData(const platform::HTTPBackgroundTask&, std::int64_t, std::int64_t) override {}
  void didFinishDownloadingToURL(const platform::HTTPBackgroundTask&, const std::filesystem::path&) override {
  }
  void didCompleteWithError(const platform::HTTPBackgroundTask&, const std::optional<Error>&) override {}
  void didFinishEventsForBackgroundURLSession() override {}

 private:
  void start() {
    session_ = platform_.httpSessions().backgroundSession(configuration_, *this);
    platform_.activityScheduler().registerActivity(kActivity, {300s, 600s, 300s, true, true},
                                                   [this](const auto&) { upload(); });
  }

  void upload() {
    platform::HTTPRequest request;
    request.url = "https://service.test/feedback";
    request.method = "POST";
    if (const auto task = session_->uploadTask(request, kBody, "", "")) session_->resume(*task);
  }

  platform::simulated::Scripted answer() {
    const Duration time = platform_.runtime().ticks() - begin_;
    if (minuteOf(time) < minutes_.size()) ++minutes_[minuteOf(time)];
    platform::simulated::Scripted answer;
    if (time >= plan_.goodTimes && time < plan_.goodTimes + plan_.outage)
      answer.error = platform::HTTPErrorCode::cannotConnect;
    return answer;
  }

  const FleetPlan& plan_;
  std::vector<int>& minutes_;
  platform::simulated::SimulatedPlatform platform_;
  const platform::MonotonicTime begin_ = platform_.runtime().ticks();
  platform::HTTPBackgroundSessionConfiguration configuration_;
  std::unique_ptr<platform::HTTPBackgroundSession> session_;
};

}  // namespace

std::vector<int> requestsPerMinute(const FleetPlan& plan) {
  std::vector<int> minutes(minuteOf(plan.goodTimes + plan.outage + plan.afterwards));
  for (int device = 1; device <= plan.devices; ++device)
    Device(plan, static_cast<std::uint64_t>(device), minutes).live();
  return minutes;
}

FleetHour hourFrom(const std::vector<int>& minutes, platform::Duration begin) {
  const auto first = minutes.begin() + static_cast<std::ptrdiff_t>(minuteOf(begin));
  return {*std::max_element(first, first + 60), std::accumulate(first, first + 60, 0) / 60.0};
}

}  // namespace sable::test
