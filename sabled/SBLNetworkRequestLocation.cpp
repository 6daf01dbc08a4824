#include <fmt/core.h>

#include "SableKit/SBLBag.h"
#include "sabled/Assembly.h"
#include "sabled/CoarseLocation.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableLogging.h"
#include "sabled/SableURLRequestBuilder.h"

// Where the device is, as far as user, bag and host let requests say so. What the host tells is
// made coarse before it is kept: nothing finer is there to be sent or logged.
namespace sable {

using platform::LocationAuthorization;
using platform::LocationFix;

namespace {

/// How long a fix serves before the next request has the device look again.
constexpr platform::Duration kFreshFor = std::chrono::seconds(300);
/// In metres: two cells of the grid. What is finer costs the device more and is thrown away.
constexpr double kDesiredAccuracy = 10'000;

/// In metres: another town, for which there are other hints.
constexpr double kSignificantDistance = 50'000;

// Why there is no location, in the place of its source. Read by the service.
constexpr std::string_view kUserNo = "userno";
constexpr std::string_view kBagNo = "bagno";
constexpr std::string_view kErrorInit = "error.init";
constexpr std::string_view kErrorFail = "error.fail";
constexpr std::string_view kSlow = "slow";

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryRequest);
}

}  // namespace

void SBLNetworkRequestFactory::_setupLocationServices() {
  contextAccessQueue_->assertIsCurrent();
  if (context_.supportedGeoLocationSources.empty()) {
    return _setNoLocationWithReason(fmt::format("{}.{}", kBagNo, "all"));
  }
  // Stands until the manager has been started; for good when there is none.
  _setNoLocationWithReason(kErrorInit);
  platform::LocationEvents events;
  events.authorizationChanged = [this](LocationAuthorization status) {
    contextAccessQueue_->async([this, status] { didChangeAuthorization(status); });
  };
  events.fixArrived = [this](const LocationFix& fix) {
    contextAccessQueue_->async([this, fix] { didUpdateLocation(fix); });
  };
  events.failed = [this](const std::string& reason) {
    contextAccessQueue_->async([this, reason] {
      log().info("no location: {}", reason);
      _setNoLocationWithReason(kErrorFail);
    });
  };
  context_.locationManager =
      assembly_.platform.locationService().makeManager(locationQueue_, kDesiredAccuracy, std::move(events));
  if (context_.locationManager == nullptr) return log().error("there is no location manager");
  // Where nobody has been asked yet, the first request that wants a location asks.
  const LocationAuthorization status = context_.locationManager->authorizationStatus();
  if (status != LocationAuthorization::notDetermined) didChangeAuthorization(status);
}

void SBLNetworkRequestFactory::didChangeAuthorization(LocationAuthorization status) {
  contextAccessQueue_->assertIsCurrent();
  const bool enabled = assembly_.platform.locationService().locationServicesEnabled();
  log().info("location services are {}, authorization is {:d}", enabled ? "on" : "off",
             static_cast<int>(status));
  if (enabled && isAuthorized(status)) return _startUpdatingLocation();
  _setNoLocationWithReason(kUserNo);
  stopUpdatingLocation();
}

void SBLNetworkRequestFactory::didUpdateLocation(const LocationFix& fix) {
  _setLocationIfAllowedByBag(fix);
  // One fix is enough: until a request finds it too old, the device need not look for another.
  stopUpdatingLocation();
}

void SBLNetworkRequestFactory::startUpdatingLocationFor(const Builder& builder) {
  if (!builder.isTraced()) _startUpdatingLocation();
}

void SBLNetworkRequestFactory::_startUpdatingLocation() {
  contextAccessQueue_->assertIsCurrent();
  if (context_.locationManager == nullptr) return;
  if (context_.geoLocation) {
    // A fix from far in the future is as bad as an old one: the clock may have been set back.
    const platform::WallTime now = assembly_.runtime.now(), taken = context_.geoLocation->timestamp;
    if (taken > now - kFreshFor && taken < now + kFreshFor) return;
  } else if (context_.geoLocationSource == kErrorInit) {
    _setNoLocationWithReason(kSlow);
  }
  locationQueue_->async([manager = context_.locationManager] { manager->startUpdatingLocation(); });
}

void SBLNetworkRequestFactory::stopUpdatingLocation() {
  contextAccessQueue_->assertIsCurrent();
  locationQueue_->async([manager = context_.locationManager] { manager->stopUpdatingLocation(); });
}

std::string_view SBLNetworkRequestFactory::_locationSourceForLocation(const LocationFix& fix) {
  switch (fix.type) {
    case 1:
    case 2:
    case 3:
    case 9:
      return "gps";
    case 6:
    case 7:
    case 8:
      return "cell";
    case 4:
    case 5:
      return "wifi";
    default:
      return "unknown";
  }
}

bool SBLNetworkRequestFactory::_setLocationIfAllowedByBag(const LocationFix& fix) {
  contextAccessQueue_->assertIsCurrent();
  const std::string source(_locationSourceForLocation(fix));
  if (!context_.supportedGeoLocationSources.contains(source)) {
    _setNoLocationWithReason(fmt::format("{}.{}", kBagNo, source));
    return false;
  }
  return _setLocation(fix, source);
}

bool SBLNetworkRequestFactory::_setLocation(const LocationFix& fix, const std::string& source) {
  const auto place = coarseLocation(fix.latitude, fix.longitude);
  if (!place) {
    log().error("no location: the host's is not on Earth");
    _setNoLocationWithReason(kErrorFail);
    return false;
  }
  context_.geoLocation = Context::Location{*place, fix.timestamp};
  context_.geoLocationLatLng = place->text();
  context_.geoLocationSource = source;
  log().info("location: {}", source);
  return true;
}

void SBLNetworkRequestFactory::_setNoLocationWithReason(std::string_view reason) {
  contextAccessQueue_->assertIsCurrent();
  context_.geoLocation.reset();
  context_.geoLocationLatLng.clear();
  context_.lookupPlace.reset();
  context_.lookupGeoLocationLatLng.clear();
  context_.geoLocationSource = reason;
  log().info("location: {}", reason);
}

void SBLNetworkRequestFactory::setPerformedSearch() {
  contextAccessQueue_->async([this] {
    if (context_.geoLocation) noteLookupPlace(context_.geoLocation->place);
  });
}

void SBLNetworkRequestFactory::noteLookupPlace(const CoarseLocation& place) {
  contextAccessQueue_->assertIsCurrent();
  context_.lookupPlace = place;
  context_.lookupGeoLocationLatLng = place.text();
  if (!context_.downloadPlace || distance(*context_.downloadPlace, place) < kSignificantDistance) return;
  context_.downloadPlace.reset();  // one move is told once
  log().info("the device has moved far");
  assembly_.runtime.globalQueue(platform::QualityOfService::standard).async([this] {
    assembly_.notificationCenter.post({kSBLSignificantLocationChangeNotification, this, {}});
  });
}

const std::string& SBLNetworkRequestFactory::_getLookupLatLng() const {
  contextAccessQueue_->assertIsCurrent();
  return context_.lookupGeoLocationLatLng;
}

}  // namespace sable
