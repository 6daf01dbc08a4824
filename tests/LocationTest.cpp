#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "sabled/CoarseLocation.h"
#include "sabled/RequestTrace.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "tests/support/VirtualDevice.h"

// What requests say about where the device is, or why they say nothing.
namespace sable::test {
namespace {

using platform::LocationAuthorization;
using platform::LocationFix;

TEST(CoarseLocation, HasTheMiddleOfItsCell) {
  struct Case {
    double latitude, longitude;
    std::string text;
  };
  const Case cases[] = {
      {0, 0, "0.000000,0.000000"},
      {-0.0, -0.0, "0.000000,0.000000"},
      {-0.01, -0.01, "0.000000,0.000000"},
      {0.024, 0.026, "0.000000,0.050000"},
      {51.507351, -0.127758, "51.500000,-0.100000"},
      {51.526, -0.04, "51.550000,0.000000"},
      {-33.868820, 151.209290, "-33.850000,151.200000"},
      {60, 24.96, "60.000000,25.000000"},
      {60.05, 24.96, "60.050000,25.000000"},
      {60.05, 25.11, "60.050000,25.200000"},
      {78.22, 15.65, "78.200000,15.600000"},
      {10, 180, "10.000000,-180.000000"},
      {10, -180, "10.000000,-180.000000"},
      {10, 179.96, "10.000000,-180.000000"},
      {10, -179.96, "10.000000,-180.000000"},
      {89.95, 180, "89.950000,-120.000000"},
      {89.95, -180, "89.950000,-120.000000"},
      {90, 123.4, "90.000000,0.000000"},
      {89.99, -77, "90.000000,0.000000"},
      {-90, 180, "-90.000000,0.000000"},
  };
  for (const Case& each : cases) {
    const auto place = coarseLocation(each.latitude, each.longitude);
    ASSERT_TRUE(place) << each.text;
    EXPECT_EQ(place->text(), each.text) << each.latitude << ", " << each.longitude;
    EXPECT_EQ(coarseLocation(place->latitude, place->longitude), place) << each.text << ": not its own cell";
  }
  const double nan = std::nan(""), infinity = std::numeric_limits<double>::infinity();
  for (const auto& [latitude, longitude] : {std::pair{90.1, 0.0},
                                            {-90.1, 0.0},
                                            {0.0, 180.1},
                                            {0.0, -180.1},
                                            {nan, 0.0},
                                            {0.0, nan},
                                            {infinity, 0.0}}) {
    EXPECT_FALSE(coarseLocation(latitude, longitude)) << latitude << ", " << longitude;
  }
}

TEST(CoarseLocation, NoCellIsNarrowerThanHighNorMuchWiderThanTwiceThat) {
  constexpr double kHeight = 0.05, kDegree = 3.14159265358979 / 180;
  for (int row = -1799; row < 1800; ++row) {
    const double latitude = row * kHeight;
    double next = 0;  // the first longitude of the cell beside that of 0
    while (coarseLocation(latitude, next)->longitude == 0) next += kHeight / 4;
    const double width = coarseLocation(latitude, next)->longitude * std::cos(latitude * kDegree);
    EXPECT_GE(width, kHeight * 0.999999) << latitude;
    EXPECT_LE(width, kHeight * 2.1) << latitude;
  }
}

class Location : public testing::Test {
 protected:
  Location() {
    device.bag["geo_location_sources"] = {"gps", "wifi"};
    device.platform.userDefaults().setByUser("SBLNoQueryCache", true);  // every search is to be sent
  }

  /// What the newest request to a path says; "-" for nothing.
  std::string sent(std::string_view name, std::string_view path = "/search") {
    return sentValue(device.service.requests(path).back().request, name);
  }
  /// "latlng geosrc" of a new search.
  std::string searched() {
    device.client().search("weather");
    return sent("latlng") + " " + sent("geosrc");
  }
  void start(LocationAuthorization status) {
    location.authorize(status);
    device.start();
  }
  void deliver(int type = 4, platform::Duration age = 0s) {
    location.deliver({51.507351, -0.127758, type, device.platform.runtime().now() - age});
    device.run();
  }
  /// What a download says; "-" for nothing.
  std::string fuzzedLocation() {
    const std::string url = "https://service.test/file";
    return sentValue(device.assembly().requestFactory->fileDownloadRequest(url, "", true),
                     "X-Kestrel-FuzzedLatLong");
  }

  VirtualDevice device;
  platform::simulated::SimulatedLocationService& location = device.platform.locationService();
};

TEST_F(Location, ItsSourceFollowsFromTheKindOfTheFix) {
  device.bag["geo_location_sources"] = {"gps", "wifi", "cell", "unknown"};
  start(LocationAuthorization::always);
  const std::map<int, std::string> sources{{0, "unknown"}, {1, "gps"},  {2, "gps"},      {3, "gps"},
                                           {4, "wifi"},    {5, "wifi"}, {6, "cell"},     {7, "cell"},
                                           {8, "cell"},    {9, "gps"},  {10, "unknown"}, {-1, "unknown"}};
  for (const auto& [type, source] : sources) {
    deliver(type);
    EXPECT_EQ(searched(), "51.500000,-0.100000 " + source) << type;
  }
  EXPECT_FALSE(device.log.contains("51.507")) << "nothing finer than the grid is logged";
  EXPECT_FALSE(device.log.contains("0.127"));
}

TEST_F(Location, EveryReasonForNoneIsOnTheWire) {
  start(LocationAuthorization::always);
  EXPECT_EQ(searched(), "- slow") << "allowed, but no fix yet";
  deliver(99);
  EXPECT_EQ(searched(), "- bagno.unknown");
  deliver(1);
  EXPECT_EQ(searched(), "51.500000,-0.100000 gps");
  location.fail();
  EXPECT_EQ(searched(), "- error.fail");
  location.deliver({91, 0, 1, device.platform.runtime().now()});
  EXPECT_EQ(searched(), "- error.fail") << "no place on Earth";
  deliver(5);
  EXPECT_EQ(searched(), "51.500000,-0.100000 wifi");
  location.authorize(LocationAuthorization::denied);
  EXPECT_EQ(searched(), "- userno") << "revoked: what was known is forgotten";
  location.authorize(LocationAuthorization::whenInUse);
  device.run();
  EXPECT_TRUE(location.isUpdating());
  deliver(4);
  EXPECT_EQ(searched(), "51.500000,-0.100000 wifi");
  location.enabled = false;
  location.authorize(LocationAuthorization::whenInUse);
  EXPECT_EQ(searched(), "- userno") << "location services are off";
}

TEST_F(Location, WithoutAManagerOrPermissionNothingIsLookedFor) {
  location.canMakeManager = false;
  device.start();
  EXPECT_EQ(searched(), "- error.init");
  location.canMakeManager = true;
  for (const auto status : {LocationAuthorization::denied, LocationAuthorization::restricted}) {
    location.authorize(status);
    device.restart();
    EXPECT_FALSE(location.isUpdating());
    EXPECT_EQ(searched(), "- userno");
  }
  location.authorize(LocationAuthorization::notDetermined);
  device.restart();
  EXPECT_FALSE(location.isUpdating()) << "nobody has been asked, so nobody is asked before a search";
  EXPECT_EQ(searched(), "- slow");
  EXPECT_TRUE(location.isUpdating());
}

TEST_F(Location, TheFirstBagDecidesWhetherThereIsAnyAndLaterOnesWhichSourcesCount) {
  device.bag.erase("geo_location_sources");
  start(LocationAuthorization::always);
  device.bag["geo_location_sources"] = {"gps"};
  device.publishBag();
  EXPECT_EQ(searched(), "- bagno.all");
  EXPECT_FALSE(location.isUpdating());

  device.restart();
  deliver(7);
  EXPECT_EQ(searched(), "- bagno.cell");
  device.bag["geo_location_sources"] = {"cell"};
  device.publishBag();
  EXPECT_EQ(searched(), "- bagno.cell") << "until the next fix";
  deliver(7);
  EXPECT_EQ(searched(), "51.500000,-0.100000 cell");
}

TEST_F(Location, AFixServesForFiveMinutes) {
  start(LocationAuthorization::always);
  EXPECT_EQ(location.starts(), 1);
  deliver(4, 299s);
  EXPECT_FALSE(location.isUpdating()) << "one fix is enough";
  searched();
  EXPECT_EQ(location.starts(), 1);
  device.advance(2s);
  EXPECT_EQ(searched(), "51.500000,-0.100000 wifi") << "an old fix is better than none";
  EXPECT_EQ(location.starts(), 2);
  EXPECT_TRUE(location.isUpdating());
  deliver(4, -24h);
  searched();
  EXPECT_EQ(location.starts(), 3) << "a fix from a clock that was set back is no fresh one";
}

TEST_F(Location, TheseRequestsLookForIt) {
  start(LocationAuthorization::always);
  VirtualClient& client = device.client();
  SBLMoreResultsRequest more;
  more.moreResultsURL = "https://service.test/more?latlng=1,2";
  SBLCardRequest card;
  card.cardURL = "https://service.test/card";
  SBLMoreResultsRequest bareMore;
  bareMore.moreResultsURL = "https://service.test/more";
  const std::tuple<SBLAnyRequest, std::string, bool> kinds[] = {
      {more, "/more", false},
      {card, "/card", false},
      {bareMore, "/more", true},
      {SBLZeroKeywordRequest{}, "/search", true},
      {SBLLookupRequest{}, "/search", true},
  };
  for (const auto& [request, path, looks] : kinds) {
    deliver(4, 301s);
    client.ask(request);
    EXPECT_EQ(location.isUpdating(), looks) << path;
    EXPECT_EQ(sent("geosrc", path), "wifi") << path;
  }
  client.ask(more);
  EXPECT_EQ(sent("latlng", "/more"), "1,2") << "the URL's own stays";
}

TEST_F(Location, AMessagesClientTellsNothing) {
  start(LocationAuthorization::always);
  deliver();
  VirtualClient& messages = device.client("com.kestrel.messages", "Messages/1");
  messages.search("weather");
  EXPECT_EQ(sent("latlng") + sent("geosrc"), "--");
  messages.ask(SBLZeroKeywordRequest{});
  EXPECT_EQ(sent("latlng") + sent("geosrc"), "--");
}

TEST_F(Location, DownloadsTellWhereTheLastSearchWas) {
  start(LocationAuthorization::always);
  deliver();
  device.client().ask(SBLZeroKeywordRequest{});
  EXPECT_EQ(fuzzedLocation(), "-") << "nobody has searched yet";
  searched();
  EXPECT_EQ(fuzzedLocation(), "51.500000,-0.100000");
  location.deliver({48.8566, 2.3522, 4, device.platform.runtime().now()});
  device.run();
  EXPECT_EQ(fuzzedLocation(), "51.500000,-0.100000");
  searched();
  EXPECT_EQ(fuzzedLocation(), "48.850000,2.400000");
  location.authorize(LocationAuthorization::denied);
  device.run();
  EXPECT_EQ(fuzzedLocation(), "-");
}

TEST_F(Location, WhoOnlyAsksWhatADownloadWouldTellHasToldNoPlace) {
  start(LocationAuthorization::always);
  deliver();
  searched();
  RequestTrace trace;
  device.assembly().requestFactory->fileDownloadRequest("https://service.test/file", "", true, &trace);
  location.deliver({48.8566, 2.3522, 4, device.platform.runtime().now()});
  device.run();
  searched();
  EXPECT_FALSE(device.log.contains("the device has moved far"));
  fuzzedLocation();
  deliver();
  searched();
  EXPECT_TRUE(device.log.contains("the device has moved far"));
}

class Context : public Location {};

TEST_F(Context, TheMapsSessionIsInHeaders) {
  device.platform.mapsService().sessions = {{"id-1", "entity-1"}, {"id-2", "entity-2"}};
  device.start();
  SBLNetworkRequestFactory& factory = *device.assembly().requestFactory;
  const auto header = [&](const char* name) {
    searched();
    return sent(name);
  };
  EXPECT_EQ(header("X-Kestrel-GeoSession"), "id-1");
  EXPECT_EQ(factory.getMapsUserSessionEntityAndReset(true)->entityString, "entity-2");
  EXPECT_EQ(header("X-Kestrel-GeoSession"), "id-2");
  EXPECT_EQ(header("X-Kestrel-GeoMetadata"), "-");
  device.platform.mapsService().changeMetadata("meta");
  EXPECT_EQ(header("X-Kestrel-GeoMetadata"), "meta");
}

TEST_F(Context, ATemperatureUnitStaysUntilThereIsAnother) {
  device.start();
  auto values = device.platform.localeInfo().values;
  searched();
  EXPECT_EQ(sent("temp"), "F");
  values.temperatureUnit.reset();
  values.measurementSystem = "Metric";
  device.platform.localeInfo().change(values);
  searched();
  EXPECT_EQ(sent("temp") + sent("units"), "FSI");
}

}  // namespace
}  // namespace sable::test
