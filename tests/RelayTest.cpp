#include <gtest/gtest.h>

#include "platform/Relay.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform {
namespace {

constexpr RelayMethod kMethods[] = {{"Echo", "ay", "ay"}};
constexpr RelayInterface kInterface{"com.kestrel.Test", "/com/kestrel/test", kMethods};

TEST(HostRelay, Echo) {
  std::string folder = ::testing::TempDir() + "relay";
  host::HostRuntime runtime;
  host::HostRelayConfiguration c;
  c.runtimeFolder = folder;
  host::HostRelay relay(runtime, c);
  auto listener = relay.namedListener("test");
  std::shared_ptr<RelayConnection> held;
  listener->setAcceptHandler([&](std::shared_ptr<RelayConnection> connection) {
    connection->exportObject(kInterface,
                             [](RelayCall call) { call.reply(std::get<Data>(call.arguments[0])); });
    connection->resume();
    held = connection;
    return true;
  });
  auto ok = listener->resume();
  ASSERT_TRUE(ok) << ok.error().description();
  auto client = relay.connect(listener->endpoint());
  ASSERT_TRUE(client);
  (*client)->resume();
  auto s = runtime.semaphore(0);
  std::string got;
  for (int i = 0; i < 1000; ++i) {
    (*client)->call(kInterface, 0, {makeData("hello")}, std::chrono::seconds(5),
                    [&](Expected<RelayArguments> r) {
                      got = r ? *std::get<Data>(r->at(0)) : r.error().description();
                      s->signal();
                    });
    ASSERT_TRUE(s->wait(runtime.ticks() + std::chrono::seconds(6)));
    ASSERT_EQ(got, "hello");
  }
}

}  // namespace
}  // namespace sable::platform
