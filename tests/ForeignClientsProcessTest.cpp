#include <gtest/gtest.h>

#include "tests/support/World.h"

// Any D-Bus client can talk to the daemon: the same small scenario, told by several of them.
namespace sable::test {
namespace {

constexpr const char* kPath = "/com/kestrel/sabled";
constexpr const char* kInterface = "com.kestrel.SBLDaemonRelay";

TEST(ForeignClients, BusctlIntrospectsAndConfigures) {
  const World world;
  const auto call = [&](std::vector<std::string> words) {
    words.insert(words.begin(), {"busctl", "--address=" + world.address()});
    return world.run(words);
  };
  const auto introspected = call({"introspect", "com.kestrel.sabled", kPath});
  EXPECT_EQ(introspected.exitCode, 0);
  for (const char* method :
       {".Configure", ".Bag", ".Request", ".ReportEvent", ".ReportEventData", ".Feedback", ".ListenToFlusher",
        ".ListSessions", ".FileHandleAndAttributesForResource"}) {
    EXPECT_NE(introspected.output.find(method), std::string::npos) << method << introspected.output;
  }
  const auto configured = call({"call", "com.kestrel.sabled", kPath, kInterface, "Configure", "a{sv}", "2",
                                "identifier", "s", "busctl", "userAgent", "s", "busctl/1"});
  EXPECT_EQ(configured.exitCode, 0);
  EXPECT_NE(configured.output.find("s \"unix:path="), std::string::npos) << configured.output;
  EXPECT_NE(call({"call", "com.kestrel.sabled", kPath, kInterface, "NoSuchMethod"}).exitCode, 0);
}

TEST(ForeignClients, GdbusConfigures) {
  const World world;
  const auto result = world.run({"gdbus", "call", "--address", world.address(), "--dest", "any.name",
                                 "--object-path", kPath, "--method", std::string(kInterface) + ".Configure",
                                 "{'identifier': <'gdbus'>, 'userAgent': <'gdbus/1'>}"});
  EXPECT_EQ(result.exitCode, 0);
  EXPECT_NE(result.output.find("('unix:path="), std::string::npos) << result.output;
}

TEST(ForeignClients, DbusSendAsksAPeerForItsSessionsWithoutADestination) {
  const World world;
  const auto result = world.run({"dbus-send", "--peer=" + world.address(), "--print-reply", kPath,
                                 std::string(kInterface) + ".ListSessions"});
  EXPECT_EQ(result.exitCode, 0);
  EXPECT_NE(result.output.find("array ["), std::string::npos) << result.output;
}

TEST(ForeignClients, APythonLibraryConfiguresAndSearches) {
  const World world;
  const auto script = world.folder("client.py");
  writeFile(script, R"(
import sys
from jeepney import DBusAddress, new_method_call
from jeepney.io.blocking import open_dbus_connection

connection = open_dbus_connection(sys.argv[1])
daemon = DBusAddress('/com/kestrel/sabled', bus_name='com.kestrel.sabled', interface='com.kestrel.SBLDaemonRelay')
configuration = {'identifier': ('s', 'python'), 'userAgent': ('s', 'python/1')}
endpoint, = connection.send_and_get_reply(new_method_call(daemon, 'Configure', 'a{sv}', (configuration,))).body
assert endpoint.startswith('unix:path='), endpoint
record = {'queryId': ('t', 1), 'queryString': ('s', 'dog'), 'verboseReply': ('b', True)}
query_id, reply, error = connection.send_and_get_reply(
    new_method_call(daemon, 'Request', 'sa{sv}', ('SBLSearchRequest', record))).body
assert query_id == 1, query_id
assert error == {}, error
assert reply['data'][1].startswith(b'['), reply
assert reply['httpResponse'][1]['status'] == ('x', 200), reply
print('answered')
)");
  const auto result = world.run({"/usr/bin/python3", script.string(), world.address()});
  EXPECT_EQ(result.output, "answered\n") << readFile(world.folder("command.err")) << world.daemonErrors();
}

}  // namespace
}  // namespace sable::test
