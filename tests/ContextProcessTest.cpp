#include <gtest/gtest.h>

#include <algorithm>
#include <map>

#include "tests/support/TemporaryFolder.h"
#include "tests/support/World.h"

// The real daemon, when its device changes under it: what the next request says.
namespace sable::test {
namespace {

using nlohmann::json;

/// A world whose bag is changed before the daemon starts.
class ChangingWorld {
 public:
  explicit ChangingWorld(const json& bag, std::string facts,
                         std::map<std::string, std::string> environment = {})
      : world_({.serviceArguments = {"--bag", bagFile(bag)},
                .settings = "SBLUseBramble = false\nSBLNoQueryCache = true",
                .facts = std::move(facts),
                .environment = std::move(environment)}) {}

  /// Rewrites the facts; waits until the daemon has logged `text` once more.
  void change(std::string_view facts, std::string_view text) {
    const auto before = occurrences(world_.daemonErrors(), text);
    writeFile(world_.folder("config") / "facts.toml", facts);
    world_.waitForLog(text, before + 1);
  }
  /// What a new search says in its items of these names, "-" for nothing.
  std::string searched(const std::vector<std::string>& names = {"latlng", "geosrc"}) {
    EXPECT_EQ(world_.sablectl({"search", "weather"}).exitCode, 0);
    const json sent = world_.requests("/search", ++searches_).back();
    std::string text;
    for (const auto& name : names) {
      const auto item =
          std::ranges::find_if(sent["items"], [&](const json& each) { return each[0] == name; });
      text += (text.empty() ? "" : " ") + (item == sent["items"].end() ? "-" : (*item)[1].get<std::string>());
    }
    return text;
  }
  /// Waits until the reason for having no location is this one, and expects it in the next search.
  void expectNoLocation(const std::string& reason) {
    world_.waitForLog("location: " + reason);
    EXPECT_EQ(searched(), "- " + reason);
  }
  World& world() { return world_; }

 private:
  std::string bagFile(const json& bag) {
    writeFile(folder_ / "bag.json", bag.dump());
    return folder_ / "bag.json";
  }

  TemporaryFolder folder_;
  World world_;
  std::size_t searches_ = 0;
};

const json kAnySource{{"geo_location_sources", {"gps", "wifi", "cell", "unknown"}}};
constexpr std::string_view kBagChecked = "checking to see if bag needs update";
constexpr std::string_view kBagHere = "Got bag: ";

std::string facts(std::string_view locale, std::string_view country, std::string_view rest) {
  return "locale = \"" + std::string(locale) + "\"\ncountry_code = \"" + std::string(country) + "\"\n" +
         std::string(rest);
}

TEST(ContextProcess, AChangeOfTheDeviceIsInTheNextRequestAndInTheBagsWhereItMatters) {
  constexpr std::string_view kBefore =
      "time_zone = \"Europe/London\"\n[location]\nlatitude = 51.507351\nlongitude = -0.127758\ntype = 4\n";
  constexpr std::string_view kAfter =
      "time_zone = \"Europe/Berlin\"\nmanaged_account = true\n"
      "[location]\nlatitude = 52.52\nlongitude = 13.405\ntype = 1\n";
  const std::vector<std::string> all{"latlng", "geosrc", "locale", "cc", "time_zone", "mode"};
  ChangingWorld device(kAnySource, facts("en_GB", "GB", kBefore));
  World& world = device.world();
  world.waitForLog("location: wifi");
  EXPECT_EQ(device.searched(all), "51.500000,-0.100000 wifi en_GB GB Europe/London -");

  device.change(facts("de_DE", "GB", kBefore), kBagHere);
  EXPECT_EQ(device.searched({"locale"}), "de_DE");  // and by then the bag's fetch is over
  device.change(facts("de_DE", "DE", kBefore), kBagHere);
  const auto bags = world.requests("/bag", 3);
  EXPECT_EQ(bags[1]["items"].dump().find("en_GB"), std::string::npos) << bags[1];
  EXPECT_NE(bags[2]["items"].dump().find(R"(["cc","DE"])"), std::string::npos) << bags[2];

  device.change(facts("de_DE", "DE", kAfter), "location: gps");
  EXPECT_EQ(device.searched(all), "52.500000,13.400000 gps de_DE DE Europe/Berlin managed");

  device.change(facts("de_DE", "DE", "[location]\nauthorization = 2\n"), "location: userno");
  EXPECT_EQ(device.searched({"mode"}), "-");
  device.change(facts("de_DE", "DE", "media_store_allowed = false\n[location]\nauthorization = 2\n"),
                "updating device restriction status to: 1");
  EXPECT_EQ(device.searched({"mode"}), "managed");
  EXPECT_EQ(world.requests("/bag", 3).size(), 3u) << "what the bag does not depend on does not fetch it";
  EXPECT_EQ(occurrences(world.daemonErrors(), kBagChecked), 2u);
  for (const char* exact : {"51.507", "0.1277", "52.52,", "13.405"}) {
    EXPECT_EQ(occurrences(world.daemonErrors(), exact), 0u) << exact << " is finer than what may be logged";
  }
}

TEST(ContextProcess, EveryReasonForNoLocationIsOnTheWire) {
  ChangingWorld device({{"geo_location_sources", {"gps"}}}, "[location]\nauthorization = 3\n");
  device.expectNoLocation("slow");
  const struct {
    const char *location, *logged, *sent;
  } rows[] = {
      {"latitude = 51.5\nlongitude = 200\ntype = 1", "location: error.fail", "- error.fail"},
      {"latitude = 51.5\nlongitude = -0.1\ntype = 1", "location: gps", "51.500000,-0.100000 gps"},
      {"type = 1", "location: error.fail", "- error.fail"},
      {"latitude = 51.5\nlongitude = -0.1\ntype = 1", "location: gps", "51.500000,-0.100000 gps"},
      {"latitude = 51.5", "location: error.fail", "- error.fail"},
      {"latitude = 51.5\nlongitude = -0.1\ntype = 5", "location: bagno.wifi", "- bagno.wifi"},
      {"authorization = 2\nlatitude = 51.5\nlongitude = -0.1\ntype = 1", "location: userno", "- userno"},
      // The last good facts stay.
      {"authorization = 4\nlatitude = \"north\"", "location is not a table", "- userno"},
  };
  for (const auto& [location, logged, sent] : rows) {
    device.change("[location]\n" + std::string(location) + "\n", logged);
    EXPECT_EQ(device.searched(), sent) << location;
  }
}

// A stand-in for GeoClue that says what it is asked for, one line each, and does as its argument says.
constexpr const char* kGeoClue = R"(
import asyncio, sys
from dbus_next import DBusError, PropertyAccess
from dbus_next.aio import MessageBus
from dbus_next.service import ServiceInterface, dbus_property, method, signal

NAME = 'org.freedesktop.GeoClue2'

class Location(ServiceInterface):
    @dbus_property(access=PropertyAccess.READ)
    def Latitude(self) -> 'd':
        return 59.329323
    @dbus_property(access=PropertyAccess.READ)
    def Longitude(self) -> 'd':
        return 18.068581
    @dbus_property(access=PropertyAccess.READ)
    def Description(self) -> 's':
        return 'somewhere'
    @dbus_property(access=PropertyAccess.READ)
    def Timestamp(self) -> '(tt)':
        return [1750000000, 5]

class Client(ServiceInterface):
    desktop, level = '', 0
    @dbus_property()
    def DesktopId(self) -> 's':
        return self.desktop
    @DesktopId.setter
    def DesktopId(self, value: 's'):
        self.desktop = value
    @dbus_property()
    def RequestedAccuracyLevel(self) -> 'u':
        return self.level
    @RequestedAccuracyLevel.setter
    def RequestedAccuracyLevel(self, value: 'u'):
        self.level = value
    @method()
    def Start(self):
        print('Start', self.desktop, self.level, flush=True)
        if sys.argv[2] == 'refuse':
            raise DBusError('org.freedesktop.DBus.Error.AccessDenied', 'no')
        if sys.argv[2] == 'locate':
            asyncio.get_running_loop().call_soon(self.LocationUpdated)
    @method()
    def Stop(self):
        print('Stop', flush=True)
    @signal()
    def LocationUpdated(self) -> 'oo':
        return ['/', '/org/freedesktop/GeoClue2/Client/1/Location/0']

class Manager(ServiceInterface):
    @method()
    def GetClient(self) -> 'o':
        return '/org/freedesktop/GeoClue2/Client/1'

async def main():
    bus = await MessageBus(bus_address=sys.argv[1]).connect()
    bus.export('/org/freedesktop/GeoClue2/Manager', Manager(NAME + '.Manager'))
    bus.export('/org/freedesktop/GeoClue2/Client/1', Client(NAME + '.Client'))
    bus.export('/org/freedesktop/GeoClue2/Client/1/Location/0', Location(NAME + '.Location'))
    await bus.request_name(NAME)
    print('ready', flush=True)
    await bus.wait_for_disconnect()

asyncio.run(main())
)";

/// A system bus of the test's own, with the stand-in on it.
struct SystemBus {
  explicit SystemBus(const std::string& behaviour) {
    EXPECT_EQ(bus.readLine().substr(0, address.size()), address);
    if (behaviour.empty()) return;
    writeFile(folder / "geoclue.py", kGeoClue);
    geoClue.emplace(std::vector<std::string>{"/usr/bin/python3", folder / "geoclue.py", address, behaviour},
                    std::map<std::string, std::string>{}, folder / "geoclue.err");
    EXPECT_EQ(geoClue->readLine(), "ready") << readFile(folder / "geoclue.err");
  }

  TemporaryFolder folder;
  const std::string address = "unix:path=" + (folder / "bus").string();
  Program bus{
      {"dbus-daemon", "--session", "--nofork", "--nopidfile", "--print-address", "--address=" + address},
      {},
      folder / "bus.err"};
  std::optional<Program> geoClue;

  std::map<std::string, std::string> environment() const { return {{"DBUS_SYSTEM_BUS_ADDRESS", address}}; }
};

TEST(ContextProcess, GeoClueIsAskedOnceALocationIsWantedAndStoppedOnceItIsKnown) {
  SystemBus system("locate");
  ChangingWorld device(kAnySource, "", system.environment());
  EXPECT_EQ(device.searched(), "- slow") << "nobody asks before the first search";
  EXPECT_EQ(system.geoClue->readLine(), "Start com.kestrel.sabled 4");
  device.world().waitForLog("location: unknown");
  EXPECT_EQ(system.geoClue->readLine(), "Stop");
  EXPECT_EQ(device.searched(), "59.350000,18.100000 unknown");
  EXPECT_EQ(system.geoClue->readLine(), "Start com.kestrel.sabled 4") << "for that fix was old";
  EXPECT_EQ(occurrences(device.world().daemonErrors(), "59.32"), 0u);
  const auto status = device.world().sablectl({"status"});
  EXPECT_NE(status.output.find("GeoClue"), std::string::npos) << status.output;
}

TEST(ContextProcess, GeoClueMayRefuseAndMayBeMissing) {
  {
    SystemBus system("refuse");
    ChangingWorld device(kAnySource, "", system.environment());
    EXPECT_EQ(device.searched(), "- slow");
    device.expectNoLocation("userno");
    device.change("[location]\nlatitude = 1\nlongitude = 1\ntype = 6", "location: cell");
    EXPECT_EQ(device.searched(), "1.000000,1.000000 cell") << "facts stand above it";
  }
  const SystemBus empty("");
  for (const auto& environment : {empty.environment(), {{"DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nowhere"}}}) {
    ChangingWorld device(kAnySource, "", environment);
    EXPECT_EQ(device.searched(), "- slow");
    device.expectNoLocation("error.fail");
    EXPECT_EQ(occurrences(device.world().daemonErrors(), "no location: GeoClue"), 1u)
        << "not asked again at once";
  }
}

}  // namespace
}  // namespace sable::test
