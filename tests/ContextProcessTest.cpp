#include <gtest/gtest.h>

#include <map>

#include "tests/support/TemporaryFolder.h"
#include "tests/support/World.h"

// The real daemon, when its device changes under it: what the next request says.
namespace sable::test {
namespace {

using nlohmann::json;
using Items = std::map<std::string, std::string>;

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
  /// The items of a new search.
  Items searched() {
    EXPECT_EQ(world_.sablectl({"search", "weather"}).exitCode, 0);
    const json sent = world_.requests("/search", ++searches_).back();
    Items items;
    for (const auto& item : sent["items"]) items[item[0]] = item[1];
    return items;
  }
  /// "latlng geosrc" of a new search.
  std::string location() {
    const Items items = searched();
    const auto found = items.find("latlng");
    return (found == items.end() ? "-" : found->second) + " " + items.at("geosrc");
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
  ChangingWorld device(kAnySource, facts("en_GB", "GB", kBefore));
  World& world = device.world();
  world.waitForLog("location: wifi");
  Items sent = device.searched();
  EXPECT_EQ(sent["latlng"] + " " + sent["geosrc"], "51.500000,-0.100000 wifi");
  EXPECT_EQ(sent["locale"] + sent["cc"] + sent["time_zone"] + sent["mode"], "en_GBGBEurope/London");

  device.change(facts("de_DE", "GB", kBefore), kBagHere);
  EXPECT_EQ(device.searched()["locale"], "de_DE");  // and by then the bag's fetch is over
  device.change(facts("de_DE", "DE", kBefore), kBagHere);
  const auto bags = world.requests("/bag", 3);
  EXPECT_EQ(bags[1]["items"].dump().find("en_GB"), std::string::npos) << bags[1];
  EXPECT_NE(bags[2]["items"].dump().find(R"(["cc","DE"])"), std::string::npos) << bags[2];

  device.change(facts("de_DE", "DE", R"(
time_zone = "Europe/Berlin"
managed_account = true
[location]
latitude = 52.52
longitude = 13.405
type = 1
)"),
                "location: gps");
  sent = device.searched();
  EXPECT_EQ(sent["latlng"] + " " + sent["geosrc"], "52.500000,13.400000 gps");
  EXPECT_EQ(sent["locale"] + sent["cc"] + sent["time_zone"] + sent["mode"], "de_DEDEEurope/Berlinmanaged");

  device.change(facts("de_DE", "DE", "[location]\nauthorization = 2\n"), "location: userno");
  EXPECT_EQ(device.searched()["mode"], "");
  device.change(facts("de_DE", "DE", "media_store_allowed = false\n[location]\nauthorization = 2\n"),
                "updating device restriction status to: 1");
  EXPECT_EQ(device.searched()["mode"], "managed");
  EXPECT_EQ(world.requests("/bag", 3).size(), 3u) << "what the bag does not depend on does not fetch it";
  EXPECT_EQ(occurrences(world.daemonErrors(), kBagChecked), 2u);
  for (const char* exact : {"51.507", "0.1277", "52.52,", "13.405"}) {
    EXPECT_EQ(occurrences(world.daemonErrors(), exact), 0u) << exact << " is finer than what may be logged";
  }
}

TEST(ContextProcess, EveryReasonForNoLocationIsOnTheWire) {
  const auto located = [](std::string_view table) { return "[location]\n" + std::string(table) + "\n"; };
  {
    ChangingWorld device({{"geo_location_sources", {"gps"}}}, located("authorization = 3"));
    device.world().waitForLog("location: slow");
    EXPECT_EQ(device.location(), "- slow");
    device.change(located("latitude = 51.5\nlongitude = 200\ntype = 1"), "location: error.fail");
    EXPECT_EQ(device.location(), "- error.fail");
    device.change(located("latitude = 51.5\nlongitude = -0.1\ntype = 1"), "location: gps");
    EXPECT_EQ(device.location(), "51.500000,-0.100000 gps");
    device.change(located("latitude = 51.5"), "location: error.fail");
    EXPECT_EQ(device.location(), "- error.fail");
    device.change(located("latitude = 51.5\nlongitude = -0.1\ntype = 5"), "location: bagno.wifi");
    EXPECT_EQ(device.location(), "- bagno.wifi");
    device.change(located("authorization = 2\nlatitude = 51.5\nlongitude = -0.1\ntype = 1"),
                  "location: userno");
    EXPECT_EQ(device.location(), "- userno");
    device.change(located("authorization = 4\nlatitude = \"north\""), "location is not a table");
    EXPECT_EQ(device.location(), "- userno") << "the last good facts stay";
  }
  ChangingWorld closed({{"geo_location_sources", json::array()}}, located("latitude = 51.5\nlongitude = 0"));
  closed.world().waitForLog("location: bagno.all");
  EXPECT_EQ(closed.location(), "- bagno.all");
}

// A stand-in for GeoClue that says what it is asked for, one line each, and does as its argument says.
constexpr const char* kGeoClue = R"(
import asyncio, sys
from dbus_next import DBusError, PropertyAccess
from dbus_next.aio import MessageBus
from dbus_next.service import ServiceInterface, dbus_property, method, signal

NAME = 'org.freedesktop.GeoClue2'

class Location(ServiceInterface):
    def __init__(self):
        super().__init__(NAME + '.Location')
    @dbus_property(access=PropertyAccess.READ)
    def Latitude(self) -> 'd':
        return 59.329323
    @dbus_property(access=PropertyAccess.READ)
    def Longitude(self) -> 'd':
        return 18.068581
    @dbus_property(access=PropertyAccess.READ)
    def Accuracy(self) -> 'd':
        return 1500.0
    @dbus_property(access=PropertyAccess.READ)
    def Description(self) -> 's':
        return 'somewhere'
    @dbus_property(access=PropertyAccess.READ)
    def Timestamp(self) -> '(tt)':
        return [1750000000, 5]

class Client(ServiceInterface):
    def __init__(self):
        super().__init__(NAME + '.Client')
        self.desktop, self.level = '', 0
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
    def __init__(self):
        super().__init__(NAME + '.Manager')
    @method()
    def GetClient(self) -> 'o':
        return '/org/freedesktop/GeoClue2/Client/1'

async def main():
    bus = await MessageBus(bus_address=sys.argv[1]).connect()
    bus.export('/org/freedesktop/GeoClue2/Manager', Manager())
    bus.export('/org/freedesktop/GeoClue2/Client/1', Client())
    bus.export('/org/freedesktop/GeoClue2/Client/1/Location/0', Location())
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
  EXPECT_EQ(device.location(), "- slow") << "nobody asks before the first search";
  EXPECT_EQ(system.geoClue->readLine(), "Start com.kestrel.sabled 4");
  device.world().waitForLog("location: unknown");
  EXPECT_EQ(system.geoClue->readLine(), "Stop");
  EXPECT_EQ(device.location(), "59.350000,18.100000 unknown");
  EXPECT_EQ(system.geoClue->readLine(), "Start com.kestrel.sabled 4") << "for that fix was old";
  EXPECT_EQ(occurrences(device.world().daemonErrors(), "59.32"), 0u);
  const auto status = device.world().sablectl({"status"});
  EXPECT_NE(status.output.find("GeoClue"), std::string::npos) << status.output;
}

TEST(ContextProcess, GeoClueMayRefuseAndMayBeMissing) {
  {
    SystemBus system("refuse");
    ChangingWorld device(kAnySource, "", system.environment());
    EXPECT_EQ(device.location(), "- slow");
    device.world().waitForLog("location: userno");
    EXPECT_EQ(device.location(), "- userno");
    device.change("[location]\nlatitude = 1\nlongitude = 1\ntype = 6", "location: cell");
    EXPECT_EQ(device.location(), "1.000000,1.000000 cell") << "facts stand above it";
  }
  {
    const SystemBus empty("");
    ChangingWorld device(kAnySource, "", empty.environment());
    EXPECT_EQ(device.location(), "- slow");
    device.world().waitForLog("location: error.fail");
    EXPECT_EQ(device.location(), "- error.fail");
  }
  ChangingWorld device(kAnySource, "", {{"DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nowhere"}});
  EXPECT_EQ(device.location(), "- slow");
  device.world().waitForLog("location: error.fail");
  EXPECT_EQ(device.location(), "- error.fail");
  EXPECT_EQ(occurrences(device.world().daemonErrors(), "no location: GeoClue"), 1u)
      << "not asked again at once";
}

}  // namespace
}  // namespace sable::test
