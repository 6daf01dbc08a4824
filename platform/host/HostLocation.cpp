#include "platform/host/HostLocation.h"

#include <atomic>
#include <nlohmann/json.hpp>
#include <utility>

#include "platform/host/GeoClueSearch.h"

namespace sable::platform::host {

namespace {

constexpr std::string_view kTable = "location";
/// How long GeoClue is left alone after a search in vain: people type ten letters a second.
constexpr Duration kPause = std::chrono::minutes(1);

bool systemBusIsThere(const HostSources& sources) {
  if (const auto address = sources.environment("DBUS_SYSTEM_BUS_ADDRESS")) return !address->empty();
  std::error_code ignored;
  return std::filesystem::exists(sources.root / "run/dbus/system_bus_socket", ignored);
}

/// A number of the facts in an int; 0, which means nothing anywhere, for one that has no place there.
int intMember(const Dictionary& table, std::string_view name, int absent) {
  const auto number = integerMember(table, name);
  if (!number) return absent;
  return std::in_range<int>(*number) ? static_cast<int>(*number) : 0;
}

LocationAuthorization authorizationOf(const Dictionary& table) {
  constexpr int kAbsent = static_cast<int>(LocationAuthorization::always);
  return static_cast<LocationAuthorization>(intMember(table, "authorization", kAbsent));
}

class Manager final : public LocationManager, public std::enable_shared_from_this<Manager> {
 public:
  Manager(HostRuntime& runtime, const HostFacts& facts, std::shared_ptr<SerialQueue> queue,
          double desiredAccuracy, LocationEvents events)
      : runtime_(runtime),
        facts_(facts),
        queue_(std::move(queue)),
        desiredAccuracy_(desiredAccuracy),
        events_(std::move(events)),
        lastStatus_(authorizationStatus()) {}

  void followFacts(NotificationCenter& center) {
    observation_ = center.observe(std::string(kLocationFactsDidChangeNotification),
                                  [weak = weak_from_this(), queue = queue_](const Notification&) {
                                    queue->async([weak] {
                                      if (const auto self = weak.lock()) self->factsChanged();
                                    });
                                  });
  }

  LocationAuthorization authorizationStatus() const override {
    const auto table = facts_.table(kTable);
    return table == nullptr ? geoClueStatus_.load() : authorizationOf(*table);
  }

  void startUpdatingLocation() override {
    queue_->assertIsCurrent();
    if (facts_.table(kTable) != nullptr) return tellFacts();
    if (search_ != nullptr || runtime_.ticks() < notBefore_) return;
    startSearch();
  }

  void stopUpdatingLocation() override {
    queue_->assertIsCurrent();
    search_.reset();
  }

 private:
  void factsChanged() {
    if (facts_.table(kTable) != nullptr) search_.reset();
    // Whoever hears of a new authorisation starts anew.
    if (!tellStatus()) tellFacts();
  }

  /// Tells the authorisation if it is another now; whether it was.
  bool tellStatus() {
    const LocationAuthorization status = authorizationStatus();
    if (std::exchange(lastStatus_, status) == status) return false;
    events_.authorizationChanged(status);
    return true;
  }

  void tellFacts() {
    const auto table = facts_.table(kTable);
    if (table == nullptr || !isAuthorized(authorizationOf(*table))) return;
    const auto latitude = numberMember(*table, "latitude"), longitude = numberMember(*table, "longitude");
    if (!latitude && !longitude) {
      // No fix yet, unless there was one: that must not be told any longer.
      if (std::exchange(factsHaveFix_, false)) events_.failed("the facts have no coordinates any more");
      return;
    }
    if (!latitude || !longitude) return events_.failed("the facts have one coordinate only");
    factsHaveFix_ = true;
    const auto timestamp = numberMember(*table, "timestamp");
    events_.fixArrived({*latitude, *longitude, intMember(*table, "type", 0),
                        timestamp ? wallTimeFromSecondsSince1970(*timestamp) : runtime_.now()});
  }

  void startSearch() {
    const auto weak = weak_from_this();
    GeoClueSearch::Events events;
    events.granted = [weak] {
      if (const auto self = weak.lock()) self->setGeoClueStatus(LocationAuthorization::always);
    };
    events.found = [weak](const LocationFix& fix) {
      if (const auto self = weak.lock()) self->events_.fixArrived(fix);
    };
    events.refused = [weak] {
      if (const auto self = weak.lock()) self->refused();
    };
    events.failed = [weak](const std::string& reason) {
      if (const auto self = weak.lock()) self->failed(reason);
    };
    search_ = GeoClueSearch::start(runtime_, queue_, desiredAccuracy_, std::move(events));
  }

  void setGeoClueStatus(LocationAuthorization status) {
    geoClueStatus_ = status;
    tellStatus();
  }
  void refused() {
    endSearch();
    setGeoClueStatus(LocationAuthorization::denied);
  }
  void failed(const std::string& reason) {
    endSearch();
    events_.failed(reason);
  }
  void endSearch() {
    search_.reset();
    notBefore_ = runtime_.ticks() + kPause;
  }

  HostRuntime& runtime_;
  const HostFacts& facts_;
  const std::shared_ptr<SerialQueue> queue_;
  const double desiredAccuracy_;
  const LocationEvents events_;
  NotificationCenter::Token observation_;

  std::atomic<LocationAuthorization> geoClueStatus_ = LocationAuthorization::notDetermined;

  // On queue_.
  LocationAuthorization lastStatus_;
  bool factsHaveFix_ = false;
  std::shared_ptr<GeoClueSearch> search_;
  MonotonicTime notBefore_;
};

}  // namespace

bool HostLocationService::locationServicesEnabled() const {
  return facts_.table(kTable) != nullptr || systemBusIsThere(facts_.sources());
}

std::shared_ptr<LocationManager> HostLocationService::makeManager(std::shared_ptr<SerialQueue> queue,
                                                                  double desiredAccuracy,
                                                                  LocationEvents events) {
  auto manager =
      std::make_shared<Manager>(runtime_, facts_, std::move(queue), desiredAccuracy, std::move(events));
  manager->followFacts(notificationCenter_);
  return manager;
}

Availability HostLocationService::availability() const {
  if (facts_.table(kTable) != nullptr) return {"LocationService", true, "location of the facts"};
  if (systemBusIsThere(facts_.sources())) return {"LocationService", true, "GeoClue, asked when needed"};
  return {"LocationService", false, "neither location of the facts nor a system bus"};
}

}  // namespace sable::platform::host
