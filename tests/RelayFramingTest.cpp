#include <gtest/gtest.h>

#include "platform/host/RelayFraming.h"
#include "tests/support/RawPeer.h"

namespace sable::platform::host {
namespace {

using test::WireBytes;
using test::WireCall;

TEST(RelayFraming, OnlyACallWithoutAnythingOddIsPlain) {
  const std::string record = WireCall::record({{"identifier", "i"}});
  const struct {
    const char* name;
    std::string message;
    bool isPlain;
  } cases[] = {
      {"with a record", WireCall{.body = record}.bytes(), true},
      {"without arguments", WireCall{.signature = ""}.bytes(), true},
      {"with a text", WireCall{.signature = "s", .body = WireBytes().string("text").bytes()}.bytes(), true},
      {"whose body is not looked at", WireCall{.body = "?"}.bytes(), true},
      {"more behind it", WireCall{.body = record}.bytes() + '\0', false},
      {"cut short", WireCall{.body = record, .bodyLength = 4096}.bytes(), false},
      {"only the fixed part", WireCall{}.bytes().substr(0, kRelayFixedBytes), false},
      {"no call", WireCall{.type = 2}.bytes(), false},
      {"another version", WireCall{.version = 2}.bytes(), false},
      {"another byte order", WireCall{.endianness = 'B'}.bytes(), false},
      {"descriptors", WireCall{.descriptors = 1}.bytes(), false},
      {"no path", WireCall{.path = "relative"}.bytes(), false},
      {"a path to the process itself", WireCall{.path = "/org/freedesktop/DBus/Local"}.bytes(), false},
      {"no interface", WireCall{.interface = "one"}.bytes(), false},
      {"no member", WireCall{.member = ""}.bytes(), false},
      {"a NUL in a name", WireCall{.member = std::string("a\0b", 3)}.bytes(), false},
      {"no signature", WireCall{.signature = "a"}.bytes(), false},
  };
  for (const auto& test : cases) EXPECT_EQ(isPlainRelayCall(test.message), test.isPlain) << test.name;
}

}  // namespace
}  // namespace sable::platform::host
